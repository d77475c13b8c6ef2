// The compressed case encoding: code choice, bit-exact round trips, group
// layout, damaged records, and the stream paths (in the window and through
// the virtual calls), against a reference encoder written independently.
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
const OBS* Missing() { return vexahost::SystemMissing(); }

// Reference code choice by arithmetic on the double, not by its bits.
unsigned char ReferenceCode(std::uint64_t bits) {
  if (bits == Bits(*Missing())) return 255;
  if (bits == 0x2020202020202020ull) return 254;
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

// Encodes and decodes through the memory API in pieces of 1..`piece`
// values (groups run on across calls); 0 means one call each way.
Bytes Encode(const std::vector<OBS>& values, std::mt19937_64* rng = nullptr, std::size_t piece = 0) {
  Bytes out(VEXA_CompressedBound(values.size()));
  VEXA_CaseEncoder encoder;
  VEXA_EncodeStart(encoder, out.data());
  for (std::size_t done = 0, n; done < values.size(); done += n) {
    n = piece ? std::min<std::size_t>(1 + (*rng)() % piece, values.size() - done) : values.size();
    VEXA_EncodeValues(encoder, values.data() + done, n, Missing());
  }
  out.resize(static_cast<std::size_t>(VEXA_EncodeFinish(encoder) - out.data()));
  return out;
}

// Decodes from an exact-size heap block, so a read past the data is caught
// by the address sanitizer; the decoder must end exactly at the data's end.
bool Decode(const Bytes& data, std::size_t n, std::vector<OBS>* values, std::mt19937_64* rng = nullptr,
            std::size_t piece = 0) {
  std::unique_ptr<unsigned char[]> exact(new unsigned char[data.size() ? data.size() : 1]);
  if (!data.empty()) std::memcpy(exact.get(), data.data(), data.size());
  values->assign(n, 0.0);
  VEXA_CaseDecoder decoder;
  VEXA_DecodeStart(decoder, exact.get(), data.size());
  bool ok = true;
  for (std::size_t done = 0, k; ok && done < n; done += k) {
    k = piece ? std::min<std::size_t>(1 + (*rng)() % piece, n - done) : n;
    ok = VEXA_DecodeValues(decoder, values->data() + done, k, Missing());
  }
  EXPECT_TRUE(!ok || decoder.next == exact.get() + data.size());
  return ok;
}

::testing::AssertionResult SameBits(const std::vector<OBS>& a, const std::vector<OBS>& b) {
  if (a.size() != b.size()) return ::testing::AssertionFailure() << "sizes " << a.size() << " and " << b.size();
  for (std::size_t i = 0; i < a.size(); ++i)
    if (Bits(a[i]) != Bits(b[i]))
      return ::testing::AssertionFailure() << "value " << i << ": " << std::hex << Bits(a[i])
                                           << " vs " << Bits(b[i]);
  return ::testing::AssertionSuccess();
}

// Values of every code class and its neighbours, including patterns that a
// floating-point register would change.
std::vector<OBS> AwkwardValues() {
  return {
      FromDouble(0.0),    FromDouble(1.0),    FromDouble(-99.0), FromDouble(151.0),
      FromDouble(-100.0), FromDouble(152.0),  FromDouble(0.5),   FromDouble(-0.0),
      FromDouble(1e10),   FromText("        "), *Missing(),
      FromBits(0x7FF0000000000001ull),  // signaling NaN
      FromBits(0x7FF4000000000000ull),  // signaling NaN, low word 0
      FromBits(0xFFF0000000000001ull),  // negative signaling NaN
      FromBits(0x7FF8000000000000ull),  // quiet NaN
      FromBits(0x7FF0000000000000ull),  // infinity
      FromBits(0x0000000000000001ull),  // smallest denormal
      FromBits(0x4000000000000000ull),  // string bytes that spell 2.0 take its code
      FromText("ABCDEFGH"), FromText("AB      "), FromText("\xff\xfe\x00\x01\x80\x7f\x20\x00"),
      FromDouble(-1.0),   FromDouble(127.0),  FromDouble(128.0), FromDouble(-98.5),
  };
}

// Every high word whose exponent lies near the small-integer range, both
// signs, with a zero low word; then every integer near the range and its
// neighbour with a nonzero low word: the bit rule must agree with arithmetic.
TEST(CaseCode, ExhaustiveAroundSmallIntegers) {
  std::size_t mismatches = 0;
  auto check = [&](const OBS& v) {
    if (VEXA_CaseCode(&v, Missing()) != ReferenceCode(Bits(v)) && ++mismatches < 5)
      ADD_FAILURE() << "value " << std::hex << Bits(v);
  };
  for (std::uint32_t sign = 0; sign < 2; ++sign)
    for (std::uint32_t exponent = 1021; exponent <= 1031; ++exponent)
      for (std::uint32_t fraction = 0; fraction < (1u << 20); ++fraction)
        check(FromBits(static_cast<std::uint64_t>((sign << 31) | (exponent << 20) | fraction) << 32));
  for (int k = -120; k <= 170; ++k) {
    check(FromDouble(k));
    check(FromDouble(std::nextafter(static_cast<double>(k), 1000.0)));
  }
  EXPECT_EQ(0u, mismatches);
}

TEST(CaseCodec, AwkwardValuesRoundTripBitForBit) {
  const std::vector<OBS> values = AwkwardValues();
  const Bytes encoded = Encode(values);
  EXPECT_EQ(ReferenceEncode(values), encoded);
  std::vector<OBS> back;
  ASSERT_TRUE(Decode(encoded, values.size(), &back));
  EXPECT_TRUE(SameBits(values, back));
}

// A full group has no padding; a ninth value opens a group padded with 0.
TEST(CaseCodec, GroupsOfEightAndNine) {
  std::vector<OBS> values;
  for (int i = 0; i < 8; ++i) values.push_back(FromDouble(i == 3 ? 0.25 : i));
  Bytes encoded = Encode(values);
  EXPECT_EQ((Bytes{100, 101, 102, 253, 104, 105, 106, 107}), Bytes(encoded.begin(), encoded.begin() + 8));
  ASSERT_EQ(16u, encoded.size());
  EXPECT_EQ(Bits(0.25), Bits(*reinterpret_cast<const OBS*>(encoded.data() + 8)));

  values.push_back(FromDouble(1e300));
  encoded = Encode(values);
  ASSERT_EQ(8u + 8u + 8u + 8u, encoded.size());
  EXPECT_EQ((Bytes{253, 0, 0, 0, 0, 0, 0, 0}), Bytes(encoded.begin() + 16, encoded.begin() + 24));
  std::vector<OBS> back;
  ASSERT_TRUE(Decode(encoded, values.size(), &back));
  EXPECT_TRUE(SameBits(values, back));
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

// Empty records, every integer code, and groups that run on across calls of
// the memory API on both sides (pieces of up to 11 values).
TEST(CaseCodec, RandomRecordsMatchReferenceInAnyPieces) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937_64 rng(seed);
  for (int round = 0; round < 2000; ++round) {
    const std::vector<OBS> values = RandomRecord(rng, rng() % 60);
    const std::size_t piece = round % 2 ? 11 : 0;
    const Bytes encoded = Encode(values, &rng, piece);
    ASSERT_EQ(ReferenceEncode(values), encoded);
    std::vector<OBS> back;
    ASSERT_TRUE(Decode(encoded, values.size(), &back, &rng, piece));
    ASSERT_TRUE(SameBits(values, back));
  }
}

// Every prefix of a record is refused by the memory API and by both stream
// functions, without reading past the data.
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
      VEXA_InMemoryFile stream(0), copy(0);
      if (length) stream.Write(prefix.data(), static_cast<unsigned int>(length));
      stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
      ASSERT_FALSE(ReadCompressed(stream, back.data(), static_cast<long>(values.size())));
      stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
      ASSERT_FALSE(CopyPrecompressed(stream, copy, static_cast<long>(values.size())));
    }
  }
}

TEST(CaseCodec, UndefinedCodesAreDamage) {
  for (unsigned char bad : {0, 252}) {
    Bytes encoded = Encode(std::vector<OBS>(5, FromDouble(3.0)));
    encoded[2] = bad;
    std::vector<OBS> back;
    EXPECT_FALSE(Decode(encoded, 5, &back));
    EXPECT_EQ(Bits(*Missing()), Bits(back[2]));
    EXPECT_EQ(Bits(3.0), Bits(back[4]));
    VEXA_InMemoryFile stream(64), copy(0);
    stream.Write(encoded.data(), static_cast<unsigned int>(encoded.size()));
    stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
    EXPECT_FALSE(ReadCompressed(stream, back.data(), 5));
    stream.Seek(0, VEXA_StrBaseIO::SeekBegin);
    EXPECT_FALSE(CopyPrecompressed(stream, copy, 5));
  }
  // Padding codes after the last value are never read.
  Bytes encoded = Encode(std::vector<OBS>(3, FromDouble(1.0)));
  encoded[5] = 252;
  std::vector<OBS> back;
  EXPECT_TRUE(Decode(encoded, 3, &back));
}

// Writes random records to `out` (checking the bytes against the reference),
// copies them all to `copy`, reads the copy in order and `out` at saved
// positions. Buffers from 1 byte up keep records straddling buffer ends, so
// both the window path and the group-by-group path through Read and Write run.
void ExerciseStream(VEXA_StrBaseIO& out, VEXA_StrBaseIO& copy, unsigned seed) {
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
  starts.push_back(out.Tell());
  ASSERT_EQ(0, out.Seek(0, VEXA_StrBaseIO::SeekBegin));
  Bytes actual(expected.size());
  ASSERT_EQ(expected.size(), out.Read(actual.data(), static_cast<unsigned int>(actual.size())));
  ASSERT_TRUE(expected == actual);

  ASSERT_EQ(0, out.Seek(0, VEXA_StrBaseIO::SeekBegin));
  for (const std::vector<OBS>& record : records)
    ASSERT_TRUE(CopyPrecompressed(out, copy, static_cast<long>(record.size())));
  ASSERT_EQ(0, copy.Seek(0, VEXA_StrBaseIO::SeekBegin));
  for (std::size_t i = 0; i < records.size(); ++i) {
    std::vector<OBS> back(records[i].size());
    ASSERT_TRUE(ReadCompressed(copy, back.data(), static_cast<long>(back.size()))) << i;
    ASSERT_TRUE(SameBits(records[i], back)) << i;
    ASSERT_EQ(starts[i + 1], copy.Tell()) << i;
  }
  OBS extra;  // the data ends exactly after the last record
  EXPECT_FALSE(ReadCompressed(copy, &extra, 1));
  for (int probe = 0; probe < 100; ++probe) {
    const std::size_t i = rng() % records.size();
    ASSERT_EQ(0, out.Seek(starts[i], VEXA_StrBaseIO::SeekBegin));
    std::vector<OBS> back(records[i].size());
    ASSERT_TRUE(ReadCompressed(out, back.data(), static_cast<long>(back.size())));
    ASSERT_TRUE(SameBits(records[i], back));
  }
}

// Memory streams from empty and from large, temporary files at many buffer
// sizes, and each kind copying to the other.
TEST(CaseStreams, FastAndSlowPaths) {
  const unsigned seed = std::random_device{}();
  struct Config {
    bool fileOut, fileCopy;
    unsigned size;  // initial memory size, or file buffer size (0: default)
  } configs[] = {{false, false, 0},   {false, false, 5},   {false, false, 1u << 20}, {true, true, 1},
                 {true, true, 7},     {true, true, 8},     {true, true, 71},         {true, true, 72},
                 {true, true, 4096},  {true, true, 0},     {false, true, 3},         {true, false, 64}};
  for (const Config& c : configs) {
    SCOPED_TRACE("file " + std::to_string(c.fileOut) + std::to_string(c.fileCopy) + " size " +
                 std::to_string(c.size));
    vexahost::SetStreamBufferSize(c.size);
    auto make = [&](bool file) -> std::unique_ptr<VEXA_StrBaseIO> {
      if (file) return std::unique_ptr<VEXA_StrBaseIO>(new VEXA_TempFile("codec", true));
      return std::unique_ptr<VEXA_StrBaseIO>(new VEXA_InMemoryFile(c.size));
    };
    std::unique_ptr<VEXA_StrBaseIO> out = make(c.fileOut), copy = make(c.fileCopy);
    ExerciseStream(*out, *copy, seed + c.size);
  }
  vexahost::SetStreamBufferSize(0);
}

}  // namespace
