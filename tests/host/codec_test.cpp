// The compressed case encoding: code choice, bit-exact round trips, group
// layout, damaged records, and the stream paths (in the window and through
// the virtual calls), against a reference encoder written independently.
#include <cfloat>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "host/hostsettings.h"
#include "isort/host/iostore.h"
#include "isort/host/vexawcom.h"

namespace {

using Bytes = std::vector<unsigned char>;

std::uint64_t Bits(const OBS& v) {
  std::uint64_t b;
  std::memcpy(&b, &v, 8);
  return b;
}
OBS FromBits(std::uint64_t b) {
  OBS v;
  std::memcpy(&v, &b, 8);
  return v;
}
OBS FromDouble(double d) { return FromBits(Bits(d)); }
OBS FromText(const char (&text)[9]) {
  OBS v;
  std::memcpy(&v, text, 8);
  return v;
}

std::uint64_t MissingBits() { return Bits(*vexahost::SystemMissing()); }
constexpr std::uint64_t kBlanks = 0x2020202020202020ull;

// Reference code choice by arithmetic on the double, not by its bits.
unsigned char ReferenceCode(std::uint64_t bits) {
  if (bits == MissingBits()) return 255;
  if (bits == kBlanks) return 254;
  if (bits == 0) return 100;
  double d;
  std::memcpy(&d, &bits, 8);
  // -0.0 compares equal to 0 and so falls through to a literal.
  if (d == std::trunc(d) && d >= -99 && d <= 151 && d != 0) return static_cast<unsigned char>(d + 100);
  return 253;
}

// Reference encoder: groups of eight codes, then the literals of the group.
Bytes ReferenceEncode(const std::vector<OBS>& values) {
  Bytes out;
  for (std::size_t start = 0; start < values.size(); start += 8) {
    unsigned char control[8] = {};
    Bytes literals;
    for (std::size_t i = start; i < values.size() && i < start + 8; ++i) {
      control[i - start] = ReferenceCode(Bits(values[i]));
      if (control[i - start] == 253) {
        const unsigned char* p = reinterpret_cast<const unsigned char*>(&values[i]);
        literals.insert(literals.end(), p, p + 8);
      }
    }
    out.insert(out.end(), control, control + 8);
    out.insert(out.end(), literals.begin(), literals.end());
  }
  return out;
}

Bytes Encode(const std::vector<OBS>& values) {
  Bytes out(VEXA_CompressedBound(values.size()));
  VEXA_CaseEncoder encoder;
  VEXA_EncodeStart(encoder, out.data());
  VEXA_EncodeValues(encoder, values.data(), values.size(), vexahost::SystemMissing());
  out.resize(static_cast<std::size_t>(VEXA_EncodeFinish(encoder) - out.data()));
  return out;
}

// Decodes from an exact-size heap block, so a read past the data is caught
// by the address sanitizer.
bool Decode(const Bytes& data, std::size_t n, std::vector<OBS>* values) {
  std::unique_ptr<unsigned char[]> exact(new unsigned char[data.size() ? data.size() : 1]);
  if (!data.empty()) std::memcpy(exact.get(), data.data(), data.size());
  values->assign(n, 0.0);
  VEXA_CaseDecoder decoder;
  VEXA_DecodeStart(decoder, exact.get(), data.size());
  return VEXA_DecodeValues(decoder, values->data(), n, vexahost::SystemMissing());
}

::testing::AssertionResult SameBits(const std::vector<OBS>& a, const std::vector<OBS>& b) {
  if (a.size() != b.size()) return ::testing::AssertionFailure() << "sizes " << a.size() << " and " << b.size();
  for (std::size_t i = 0; i < a.size(); ++i)
    if (Bits(a[i]) != Bits(b[i]))
      return ::testing::AssertionFailure() << "value " << i << ": " << std::hex << Bits(a[i])
                                           << " vs " << Bits(b[i]);
  return ::testing::AssertionSuccess();
}

// Values of every code class, including patterns that a floating-point
// register would change.
std::vector<OBS> AwkwardValues() {
  return {
      FromDouble(0.0),    FromDouble(1.0),    FromDouble(-99.0), FromDouble(151.0),
      FromDouble(-100.0), FromDouble(152.0),  FromDouble(0.5),   FromDouble(-0.0),
      FromDouble(1e10),   FromText("        "), *vexahost::SystemMissing(),
      FromBits(0x7FF0000000000001ull),  // signaling NaN
      FromBits(0x7FF4000000000000ull),  // signaling NaN, low word 0
      FromBits(0xFFF0000000000001ull),  // negative signaling NaN
      FromBits(0x7FF8000000000000ull),  // quiet NaN
      FromBits(0x7FF0000000000000ull),  // infinity
      FromBits(0x0000000000000001ull),  // smallest denormal
      FromText("ABCDEFGH"), FromText("AB      "), FromText("\xff\xfe\x00\x01\x80\x7f\x20\x00"),
      FromDouble(-1.0),   FromDouble(127.0),  FromDouble(128.0), FromDouble(-98.5),
  };
}

TEST(CaseCode, EveryCodeClass) {
  const OBS* missing = vexahost::SystemMissing();
  struct Case {
    OBS value;
    unsigned char code;
  } cases[] = {
      {FromDouble(0.0), 100},    {FromDouble(1.0), 101},      {FromDouble(-99.0), 1},
      {FromDouble(151.0), 251},  {FromDouble(-100.0), 253},   {FromDouble(152.0), 253},
      {FromDouble(0.5), 253},    {FromDouble(-0.0), 253},     {FromDouble(1e10), 253},
      {FromText("        "), 254}, {*missing, 255},           {FromText("ABCDEFGH"), 253},
      {FromBits(0x7FF4000000000000ull), 253},
      // String bytes that happen to spell a small integer take its code.
      {FromBits(0x4000000000000000ull), 102},
  };
  for (const Case& c : cases)
    EXPECT_EQ(c.code, VEXA_CaseCode(&c.value, missing)) << std::hex << Bits(c.value);
}

// Every high word whose exponent lies near the small-integer range, both
// signs, with a zero low word: the bit rule must agree with arithmetic.
TEST(CaseCode, ExhaustiveAroundSmallIntegers) {
  const OBS* missing = vexahost::SystemMissing();
  std::size_t mismatches = 0;
  for (std::uint32_t sign = 0; sign < 2; ++sign) {
    for (std::uint32_t exponent = 1021; exponent <= 1031; ++exponent) {
      for (std::uint32_t fraction = 0; fraction < (1u << 20); ++fraction) {
        const std::uint32_t high = (sign << 31) | (exponent << 20) | fraction;
        const OBS v = FromBits(static_cast<std::uint64_t>(high) << 32);
        if (VEXA_CaseCode(&v, missing) != ReferenceCode(Bits(v)) && ++mismatches < 5)
          ADD_FAILURE() << "high word " << std::hex << high;
      }
    }
  }
  EXPECT_EQ(0u, mismatches);
  for (int k = -120; k <= 170; ++k) {
    const OBS v = FromDouble(k);
    const unsigned char expected = k == 0 ? 100 : (k >= -99 && k <= 151 ? k + 100 : 253);
    EXPECT_EQ(expected, VEXA_CaseCode(&v, missing)) << k;
    const OBS next = FromDouble(std::nextafter(static_cast<double>(k), 1000.0));
    EXPECT_EQ(253, VEXA_CaseCode(&next, missing)) << k;
  }
}

TEST(CaseCodec, AwkwardValuesRoundTripBitForBit) {
  const std::vector<OBS> values = AwkwardValues();
  const Bytes encoded = Encode(values);
  EXPECT_EQ(ReferenceEncode(values), encoded);
  std::vector<OBS> back;
  ASSERT_TRUE(Decode(encoded, values.size(), &back));
  EXPECT_TRUE(SameBits(values, back));
}

TEST(CaseCodec, GroupOfEightHasNoPadding) {
  std::vector<OBS> values;
  for (int i = 0; i < 8; ++i) values.push_back(FromDouble(i == 3 ? 0.25 : i));
  const Bytes encoded = Encode(values);
  ASSERT_EQ(16u, encoded.size());
  const unsigned char control[8] = {100, 101, 102, 253, 104, 105, 106, 107};
  EXPECT_EQ(0, std::memcmp(control, encoded.data(), 8));
  EXPECT_EQ(Bits(0.25), Bits(*reinterpret_cast<const OBS*>(encoded.data() + 8)));
}

TEST(CaseCodec, NinthValueOpensAPaddedGroup) {
  std::vector<OBS> values(9, FromDouble(2.0));
  values[8] = FromDouble(1e300);
  const Bytes encoded = Encode(values);
  ASSERT_EQ(8u + 8u + 8u, encoded.size());
  for (int i = 0; i < 8; ++i) EXPECT_EQ(102, encoded[i]);
  EXPECT_EQ(253, encoded[8]);
  for (int i = 9; i < 16; ++i) EXPECT_EQ(0, encoded[i]) << i;
  std::vector<OBS> back;
  ASSERT_TRUE(Decode(encoded, values.size(), &back));
  EXPECT_TRUE(SameBits(values, back));
}

// Every integer code, in groups that hold nothing else and in groups mixed
// with the other classes.
TEST(CaseCodec, EveryIntegerCodeRoundTrips) {
  std::vector<OBS> integers, mixed;
  for (int k = -99; k <= 151; ++k) {
    integers.push_back(FromDouble(k));
    mixed.push_back(FromDouble(k));
    if (k % 3 == 0) mixed.push_back(FromText("        "));
    if (k % 5 == 0) mixed.push_back(*vexahost::SystemMissing());
  }
  for (const std::vector<OBS>* values : {&integers, &mixed}) {
    const Bytes encoded = Encode(*values);
    EXPECT_EQ(ReferenceEncode(*values), encoded);
    std::vector<OBS> back;
    ASSERT_TRUE(Decode(encoded, values->size(), &back));
    EXPECT_TRUE(SameBits(*values, back));
  }
}

TEST(CaseCodec, EmptyRecord) {
  EXPECT_TRUE(Encode({}).empty());
  std::vector<OBS> back;
  EXPECT_TRUE(Decode({}, 0, &back));
}

std::vector<OBS> RandomRecord(std::mt19937_64& rng, std::size_t n) {
  static const std::vector<OBS> awkward = AwkwardValues();
  std::vector<OBS> values(n);
  for (OBS& v : values) {
    switch (rng() % 6) {
      case 0: v = FromBits(rng()); break;
      case 1: v = FromDouble(static_cast<double>(static_cast<int>(rng() % 300) - 130)); break;
      case 2: v = awkward[rng() % awkward.size()]; break;
      case 3: v = FromText("        "); break;
      case 4: v = FromDouble(static_cast<double>(rng() % 1000) / 8); break;
      default: {
        char text[9] = "        ";
        for (std::size_t i = 0, len = rng() % 9; i < len; ++i) text[i] = static_cast<char>('a' + rng() % 26);
        v = FromText(text);
      }
    }
  }
  return values;
}

TEST(CaseCodec, RandomRecordsMatchReference) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937_64 rng(seed);
  for (int round = 0; round < 2000; ++round) {
    const std::vector<OBS> values = RandomRecord(rng, rng() % 41);
    const Bytes encoded = Encode(values);
    ASSERT_EQ(ReferenceEncode(values), encoded);
    std::vector<OBS> back;
    ASSERT_TRUE(Decode(encoded, values.size(), &back));
    ASSERT_TRUE(SameBits(values, back));
  }
}

// Groups run on across calls of the memory API, on both sides.
TEST(CaseCodec, PiecewiseCallsMatchOneCall) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937_64 rng(seed);
  for (int round = 0; round < 300; ++round) {
    const std::vector<OBS> values = RandomRecord(rng, rng() % 60);
    Bytes out(VEXA_CompressedBound(values.size()));
    VEXA_CaseEncoder encoder;
    VEXA_EncodeStart(encoder, out.data());
    for (std::size_t done = 0; done < values.size();) {
      const std::size_t piece = std::min<std::size_t>(rng() % 11, values.size() - done);
      VEXA_EncodeValues(encoder, values.data() + done, piece, vexahost::SystemMissing());
      done += piece;
    }
    out.resize(static_cast<std::size_t>(VEXA_EncodeFinish(encoder) - out.data()));
    ASSERT_EQ(ReferenceEncode(values), out);

    std::vector<OBS> back(values.size());
    VEXA_CaseDecoder decoder;
    VEXA_DecodeStart(decoder, out.data(), out.size());
    for (std::size_t done = 0; done < values.size();) {
      const std::size_t piece = std::min<std::size_t>(rng() % 11, values.size() - done);
      ASSERT_TRUE(VEXA_DecodeValues(decoder, back.data() + done, piece, vexahost::SystemMissing()));
      done += piece;
    }
    EXPECT_EQ(out.data() + out.size(), decoder.next);
    ASSERT_TRUE(SameBits(values, back));
  }
}

TEST(CaseCodec, EveryTruncationIsDetected) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937_64 rng(seed);
  for (int round = 0; round < 60; ++round) {
    const std::vector<OBS> values = RandomRecord(rng, 1 + rng() % 30);
    const Bytes encoded = Encode(values);
    for (std::size_t length = 0; length < encoded.size(); ++length) {
      const Bytes prefix(encoded.begin(), encoded.begin() + static_cast<std::ptrdiff_t>(length));
      std::vector<OBS> back;
      ASSERT_FALSE(Decode(prefix, values.size(), &back)) << "prefix of " << length;

      VEXA_InMemoryFile stream(0);
      if (length) stream.Write(prefix.data(), static_cast<unsigned int>(length));
      stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
      ASSERT_FALSE(ReadCompressed(stream, back.data(), static_cast<long>(values.size())));
      stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
      VEXA_InMemoryFile copy(0);
      ASSERT_FALSE(CopyPrecompressed(stream, copy, static_cast<long>(values.size())));
    }
  }
}

TEST(CaseCodec, UndefinedCodesAreDamage) {
  for (unsigned char bad : {0, 252}) {
    std::vector<OBS> values(5, FromDouble(3.0));
    Bytes encoded = Encode(values);
    encoded[2] = bad;
    std::vector<OBS> back;
    EXPECT_FALSE(Decode(encoded, values.size(), &back));
    EXPECT_EQ(MissingBits(), Bits(back[2]));
    EXPECT_EQ(Bits(3.0), Bits(back[4]));

    VEXA_InMemoryFile stream(64), copy(0);
    stream.Write(encoded.data(), static_cast<unsigned int>(encoded.size()));
    stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
    EXPECT_FALSE(ReadCompressed(stream, back.data(), 5));
    stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
    EXPECT_FALSE(CopyPrecompressed(stream, copy, 5));
  }
  // Padding codes after the last value are never read.
  std::vector<OBS> values(3, FromDouble(1.0));
  Bytes encoded = Encode(values);
  encoded[5] = 252;
  std::vector<OBS> back;
  EXPECT_TRUE(Decode(encoded, 3, &back));
}

// Writes random records to `out`, checks the bytes against the reference,
// reads them back in order and at saved positions, and copies them.
void ExerciseStream(VEXA_StrBaseIO& out, VEXA_StrBaseIO& copyTarget, unsigned seed) {
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937_64 rng(seed);
  std::vector<std::vector<OBS>> records;
  std::vector<std::int64_t> starts;
  Bytes expected;
  for (int i = 0; i < 400; ++i) {
    records.push_back(RandomRecord(rng, rng() % 3 == 0 ? rng() % 200 : rng() % 20));
    starts.push_back(out.Tell());
    WriteCompressed(out, records.back().data(), static_cast<long>(records.back().size()));
    const Bytes encoded = ReferenceEncode(records.back());
    expected.insert(expected.end(), encoded.begin(), encoded.end());
    ASSERT_EQ(static_cast<std::int64_t>(expected.size()), out.Tell());
  }
  ASSERT_EQ(0, out.Seek(0, VEXA_StrBaseIO::SeekBegin));
  Bytes actual(expected.size());
  ASSERT_EQ(expected.size(), out.Read(actual.data(), static_cast<unsigned int>(actual.size())));
  ASSERT_TRUE(expected == actual);

  ASSERT_EQ(0, out.Seek(0, VEXA_StrBaseIO::SeekBegin));
  for (std::size_t i = 0; i < records.size(); ++i) {
    std::vector<OBS> back(records[i].size());
    ASSERT_TRUE(ReadCompressed(out, back.data(), static_cast<long>(back.size()))) << i;
    ASSERT_TRUE(SameBits(records[i], back)) << i;
    ASSERT_EQ(i + 1 < starts.size() ? starts[i + 1] : static_cast<std::int64_t>(expected.size()),
              out.Tell());
  }
  for (int probe = 0; probe < 100; ++probe) {
    const std::size_t i = rng() % records.size();
    ASSERT_EQ(0, out.Seek(starts[i], VEXA_StrBaseIO::SeekBegin));
    std::vector<OBS> back(records[i].size());
    ASSERT_TRUE(ReadCompressed(out, back.data(), static_cast<long>(back.size())));
    ASSERT_TRUE(SameBits(records[i], back));
  }
  ASSERT_EQ(0, out.Seek(0, VEXA_StrBaseIO::SeekBegin));
  for (std::size_t i = 0; i < records.size(); ++i)
    ASSERT_TRUE(CopyPrecompressed(out, copyTarget, static_cast<long>(records[i].size())));
  ASSERT_EQ(0, copyTarget.Seek(0, VEXA_StrBaseIO::SeekBegin));
  for (std::size_t i = 0; i < records.size(); ++i) {
    std::vector<OBS> back(records[i].size());
    ASSERT_TRUE(ReadCompressed(copyTarget, back.data(), static_cast<long>(back.size())));
    ASSERT_TRUE(SameBits(records[i], back));
  }
  // The data ends exactly after the last record.
  OBS extra;
  EXPECT_FALSE(ReadCompressed(copyTarget, &extra, 1));
}

TEST(CaseStreams, InMemoryFromEmptyAndFromLarge) {
  const unsigned seed = std::random_device{}();
  for (unsigned initial : {0u, 5u, 1u << 20}) {
    VEXA_InMemoryFile out(initial), copy(initial);
    ExerciseStream(out, copy, seed + initial);
  }
}

// Buffers from 1 byte up keep records straddling buffer ends, so both the
// window path and the group-by-group path through Read and Write run.
TEST(CaseStreams, TempFilesAtManyBufferSizes) {
  const unsigned seed = std::random_device{}();
  for (unsigned size : {1u, 7u, 8u, 71u, 72u, 100u, 4096u, 0u}) {
    SCOPED_TRACE("buffer " + std::to_string(size));
    vexahost::SetStreamBufferSize(size);
    {
      VEXA_TempFile out("codec", true), copy("codec", true);
      ExerciseStream(out, copy, seed + size);
    }
    vexahost::SetStreamBufferSize(0);
  }
}

TEST(CaseStreams, MemoryToFileAndBack) {
  const unsigned seed = std::random_device{}();
  for (unsigned size : {3u, 64u, 0u}) {
    vexahost::SetStreamBufferSize(size);
    {
      VEXA_InMemoryFile out(16);
      VEXA_TempFile copy("codec", true);
      ExerciseStream(out, copy, seed);
    }
    vexahost::SetStreamBufferSize(0);
  }
}

}  // namespace
