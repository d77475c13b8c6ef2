// SRTFPK, SRTFUP and SrtUnpack against a straightforward reference packer
// written from the record format, and round trips of awkward bit patterns.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "isort/host/iostore.h"
#include "sortfile_testing.h"

namespace {

using namespace sortfile_testing;

constexpr std::uint64_t kBlanks = 0x2020202020202020ull;
constexpr std::uint64_t kSignalingNaN = 0x7FF0000000000001ull;
constexpr std::uint64_t kQuietNaN = 0x7FF8000000000000ull;
constexpr std::uint64_t kNegativeZero = 0x8000000000000000ull;

std::uint64_t DoubleBits(double d) {
  std::uint64_t bits;
  std::memcpy(&bits, &d, sizeof bits);
  return bits;
}

// The code of a value, read from the code table: the system-missing pattern,
// eight blanks, +0.0, the nonzero integers -99 to 151, or the value itself.
unsigned ReferenceCode(std::uint64_t bits, std::uint64_t missing) {
  if (bits == missing) return 255;
  if (bits == kBlanks) return 254;
  if (bits == 0) return 100;
  double d;
  std::memcpy(&d, &bits, sizeof d);
  if (d == std::floor(d) && d >= -99.0 && d <= 151.0 && d != 0.0)
    return static_cast<unsigned>(d + 100.0);
  return 253;
}

struct Pair {
  FortranInt first;
  FortranInt count;
};

// A packing description: the map (key runs first), how many are key runs,
// and the key descriptor list with its closing triple.
struct Layout {
  std::vector<FortranInt> map;  // pairs
  FortranInt nkeypairs = 0;
  std::vector<FortranInt> keys = {1, -1, 1};  // triples; closed

  FortranInt Pairs() const { return static_cast<FortranInt>(map.size() / 2); }
  void AddRun(FortranInt first, FortranInt count) {
    map.push_back(first);
    map.push_back(count);
  }
  void AddStringKey(FortranInt offset, FortranInt width) {
    keys.insert(keys.end() - 3, {offset, width, 1});
  }
};

// The packed record as the format describes it, byte by byte.
std::vector<unsigned char> ReferencePack(const std::vector<OBS>& values, const Layout& layout,
                                         bool compress, FortranInt header1) {
  std::vector<unsigned char> out(8, 0);
  auto append = [&](const OBS* v) {
    const unsigned char* b = reinterpret_cast<const unsigned char*>(v);
    out.insert(out.end(), b, b + 8);
  };
  const FortranInt plain = compress ? layout.nkeypairs : layout.Pairs();
  for (FortranInt p = 0; p < plain; ++p) {
    for (FortranInt i = 0; i < layout.map[2 * p + 1]; ++i)
      append(&values[layout.map[2 * p] - 1 + i]);
  }
  if (compress) {
    const std::uint64_t missing = MissingBits();
    std::vector<unsigned char> codes;
    std::vector<const OBS*> literals;
    auto flush = [&]() {
      codes.resize(8, 0);
      out.insert(out.end(), codes.begin(), codes.end());
      for (const OBS* v : literals) append(v);
      codes.clear();
      literals.clear();
    };
    for (FortranInt p = plain; p < layout.Pairs(); ++p) {
      for (FortranInt i = 0; i < layout.map[2 * p + 1]; ++i) {
        if (codes.size() == 8) flush();
        const OBS* v = &values[layout.map[2 * p] - 1 + i];
        const unsigned code = ReferenceCode(Bits(v), missing);
        codes.push_back(static_cast<unsigned char>(code));
        if (code == 253) literals.push_back(v);
      }
    }
    if (!codes.empty()) flush();
  }
  const FortranInt header[2] = {static_cast<FortranInt>(out.size() / 4), header1};
  std::memcpy(out.data(), header, sizeof header);
  for (std::size_t k = 0; layout.keys[3 * k + 1] >= 0; ++k) {
    const std::size_t at = static_cast<std::size_t>(layout.keys[3 * k]) * 8;
    const std::size_t width = static_cast<std::size_t>(layout.keys[3 * k + 1]);
    if (width == 0 || out[at + width - 1] != ' ') continue;
    std::size_t end = width;
    while (end > 0 && out[at + end - 1] == ' ') --end;
    out[at + end] = 0;
  }
  return out;
}

// Room for any packed record of `values` values.
std::vector<FortranInt> PackedBuffer(std::size_t values) {
  return std::vector<FortranInt>(2 + 2 * values + 2 * ((values + 7) / 8) + 2, 0x5A5A5A5A);
}

std::vector<unsigned char> Pack(const std::vector<OBS>& values, const Layout& layout, bool compress,
                                FortranInt header1, std::vector<FortranInt>& buffer) {
  buffer = PackedBuffer(values.size());
  const FortranInt nmap = layout.Pairs(), c = compress ? 1 : 0;
  SRTFPK(values.data(), buffer.data(), &header1, layout.map.data(), layout.keys.data(), &nmap,
         &layout.nkeypairs, &c);
  FortranInt words;
  std::memcpy(&words, buffer.data(), sizeof words);
  const unsigned char* b = reinterpret_cast<const unsigned char*>(buffer.data());
  return std::vector<unsigned char>(b, b + 4 * static_cast<std::size_t>(words));
}

std::vector<OBS> Unpack(std::vector<FortranInt>& buffer, const Layout& layout, bool compress,
                        std::size_t nvalues, std::uint64_t sentinel, bool plainC) {
  std::vector<OBS> out(nvalues);
  for (OBS& v : out) SetBits(&v, sentinel);
  if (plainC) {
    SrtUnpack(reinterpret_cast<OBS*>(buffer.data() + 2), out.data(), layout.map.data(),
              layout.keys.data(), layout.Pairs(), layout.nkeypairs, compress);
  } else {
    const FortranInt nmap = layout.Pairs(), c = compress ? 1 : 0;
    SRTFUP(buffer.data(), out.data(), layout.map.data(), layout.keys.data(), &nmap,
           &layout.nkeypairs, &c);
  }
  return out;
}

// Packs one value compressed and returns its control code and, for 253,
// checks that the value follows whole.
unsigned PackedCode(std::uint64_t bits) {
  std::vector<OBS> values(1);
  SetBits(&values[0], bits);
  Layout layout;
  layout.AddRun(1, 1);
  std::vector<FortranInt> buffer;
  const std::vector<unsigned char> packed = Pack(values, layout, true, 0, buffer);
  const unsigned code = packed.at(8);
  EXPECT_EQ(packed.size(), code == 253 ? 24u : 16u);
  if (code == 253) {
    std::uint64_t stored;
    std::memcpy(&stored, &packed[16], sizeof stored);
    EXPECT_EQ(stored, bits);
  }
  // And back, bit for bit.
  EXPECT_EQ(Bits(&Unpack(buffer, layout, true, 1, 1, true)[0]), bits);
  return code;
}

TEST(PackingCodes, TableOfCodes) {
  EXPECT_EQ(PackedCode(DoubleBits(0.0)), 100u);
  EXPECT_EQ(PackedCode(DoubleBits(1.0)), 101u);
  EXPECT_EQ(PackedCode(DoubleBits(-99.0)), 1u);
  EXPECT_EQ(PackedCode(DoubleBits(151.0)), 251u);
  EXPECT_EQ(PackedCode(DoubleBits(-1.0)), 99u);
  EXPECT_EQ(PackedCode(DoubleBits(128.0)), 228u);
  EXPECT_EQ(PackedCode(kBlanks), 254u);
  EXPECT_EQ(PackedCode(MissingBits()), 255u);
  for (std::uint64_t bits :
       {DoubleBits(-100.0), DoubleBits(152.0), DoubleBits(0.5), DoubleBits(1e10), DoubleBits(-98.5),
        DoubleBits(150.75), DoubleBits(1e-300), kNegativeZero, kSignalingNaN, kQuietNaN,
        DoubleBits(INFINITY), std::uint64_t{1}, std::uint64_t{0x3FF0000000000001ull}}) {
    EXPECT_EQ(PackedCode(bits), 253u) << std::hex << bits;
  }
  // Every integer of the table, and the host's own code function agrees.
  const std::uint64_t missing = MissingBits();
  for (int k = -99; k <= 151; ++k) {
    OBS v;
    SetDouble(&v, k);
    EXPECT_EQ(VEXA_CaseCode(&v, vexahost::SystemMissing()), ReferenceCode(Bits(&v), missing));
  }
}

TEST(PackingCodes, EightValuesMakeOneGroupNineMakeTwo) {
  for (int n : {8, 9}) {
    std::vector<OBS> values(n);
    for (int i = 0; i < n; ++i) SetDouble(&values[i], i + 1);
    Layout layout;
    layout.AddRun(1, n);
    std::vector<FortranInt> buffer;
    const std::vector<unsigned char> packed = Pack(values, layout, true, 77, buffer);
    ASSERT_EQ(packed.size(), n == 8 ? 16u : 24u);
    EXPECT_EQ(buffer[0], n == 8 ? 4 : 6);
    EXPECT_EQ(buffer[1], 77);
    if (n == 9) {
      EXPECT_EQ(packed[16], 109);
      for (int i = 17; i < 24; ++i) EXPECT_EQ(packed[i], 0) << i;
    }
  }
}

TEST(PackingLayout, UncompressedRecordIsHeaderAndMappedValues) {
  std::vector<OBS> values(10);
  for (int i = 0; i < 10; ++i) SetDouble(&values[i], 0.25 * i);
  Layout layout;
  layout.AddRun(4, 3);
  layout.AddRun(1, 2);
  layout.AddRun(9, 0);
  layout.AddRun(8, 2);
  layout.nkeypairs = 1234;  // not read without compression
  std::vector<FortranInt> buffer;
  const std::vector<unsigned char> packed = Pack(values, layout, false, -5, buffer);
  EXPECT_EQ(buffer[0], 2 * (1 + 7));
  EXPECT_EQ(buffer[1], -5);
  EXPECT_EQ(packed, ReferencePack(values, layout, false, -5));
}

TEST(PackingLayout, LongRunsCopyTheSameBytes) {
  for (FortranInt run : {999, 1000, 1001}) {
    SCOPED_TRACE(run);
    std::vector<OBS> values(2 * run + 3);
    std::mt19937_64 random(run);
    for (OBS& v : values) SetBits(&v, random());
    for (bool compress : {false, true}) {
      Layout layout;
      layout.AddRun(2, run);
      layout.AddRun(run + 3, run);
      layout.nkeypairs = 1;
      std::vector<FortranInt> buffer;
      EXPECT_EQ(Pack(values, layout, compress, 0, buffer),
                ReferencePack(values, layout, compress, 0));
      const std::vector<OBS> back =
          Unpack(buffer, layout, compress, values.size(), kSignalingNaN, false);
      EXPECT_EQ(Bits(&back[0]), kSignalingNaN);
      EXPECT_EQ(Bits(&back[run + 1]), kSignalingNaN);
      EXPECT_EQ(0, std::memcmp(&back[1], &values[1], run * sizeof(OBS)));
      EXPECT_EQ(0, std::memcmp(&back[run + 2], &values[run + 2], run * sizeof(OBS)));
    }
  }
}

TEST(PackingStringKeys, TrimmedWithZeroAndRestored) {
  std::vector<OBS> values(6);
  SetText(&values[0], "AB", 8);
  SetText(&values[1], "", 8);
  SetText(&values[2], "ABCDEFGH", 8);
  SetText(&values[3], "HELLO", 16);  // a 12-byte key spanning two values
  SetDouble(&values[5], 3.5);
  Layout layout;
  layout.AddRun(1, 5);
  layout.AddRun(6, 1);
  layout.nkeypairs = 1;
  layout.AddStringKey(1, 8);
  layout.AddStringKey(2, 8);
  layout.AddStringKey(3, 8);
  layout.AddStringKey(4, 12);
  layout.keys.insert(layout.keys.end() - 3, {5, 0, -1});  // numeric keys are left alone
  for (bool compress : {false, true}) {
    std::vector<FortranInt> buffer;
    const std::vector<unsigned char> packed = Pack(values, layout, compress, 0, buffer);
    EXPECT_EQ(packed, ReferencePack(values, layout, compress, 0));
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(&packed[8]), 8),
              std::string("AB\0     ", 8));
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(&packed[16]), 8),
              std::string("\0       ", 8));
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(&packed[24]), 8), "ABCDEFGH");
    EXPECT_EQ(std::string(reinterpret_cast<const char*>(&packed[32]), 16),
              std::string("HELLO\0          ", 16));
    const std::vector<OBS> back = Unpack(buffer, layout, compress, values.size(), 0, true);
    EXPECT_EQ(0, std::memcmp(back.data(), values.data(), values.size() * sizeof(OBS)));
  }
}

TEST(PackingStringKeys, ListClosedAtOnceTrimsNothing) {
  std::vector<OBS> values(1);
  SetText(&values[0], "AB", 8);
  Layout layout;
  layout.AddRun(1, 1);
  layout.keys = {1, -3, 1, 1, 8, 1};  // closed before the string key
  std::vector<FortranInt> buffer;
  const std::vector<unsigned char> packed = Pack(values, layout, false, 0, buffer);
  EXPECT_EQ(std::string(reinterpret_cast<const char*>(&packed[8]), 8), "AB      ");
}

// Damaged compressed records: undefined codes and a length word that ends
// the record early give system-missing values; nothing past the length is read.
TEST(PackingDamage, UndefinedCodesAndShortRecordsGiveMissing) {
  const std::uint64_t missing = MissingBits();
  Layout layout;
  layout.AddRun(1, 4);
  // Header, one control block, one literal, then bytes that must not be read.
  std::vector<FortranInt> buffer(2 + 2 + 2 + 2);
  unsigned char* bytes = reinterpret_cast<unsigned char*>(buffer.data());
  const unsigned char control[8] = {101, 0, 252, 253, 0, 0, 0, 0};
  std::memcpy(bytes + 8, control, 8);
  const std::uint64_t literal = DoubleBits(2.5), beyond = DoubleBits(-7.25);
  std::memcpy(bytes + 16, &literal, 8);
  std::memcpy(bytes + 24, &beyond, 8);

  buffer[0] = 6;  // header, control block and the literal
  std::vector<OBS> back = Unpack(buffer, layout, true, 4, 1, true);
  EXPECT_EQ(Bits(&back[0]), DoubleBits(1.0));
  EXPECT_EQ(Bits(&back[1]), missing);
  EXPECT_EQ(Bits(&back[2]), missing);
  EXPECT_EQ(Bits(&back[3]), literal);

  // The literal lies past the record's length: it is not read.
  buffer[0] = 4;
  back = Unpack(buffer, layout, true, 4, 1, true);
  EXPECT_EQ(Bits(&back[0]), DoubleBits(1.0));
  EXPECT_EQ(Bits(&back[3]), missing);

  // A literal cut short by the length, then values coded in the control block.
  const unsigned char literalFirst[8] = {253, 101, 102, 103, 0, 0, 0, 0};
  std::memcpy(bytes + 8, literalFirst, 8);
  buffer[0] = 5;
  back = Unpack(buffer, layout, true, 4, 1, true);
  EXPECT_EQ(Bits(&back[0]), missing);
  EXPECT_EQ(Bits(&back[1]), DoubleBits(1.0));
  EXPECT_EQ(Bits(&back[3]), DoubleBits(3.0));

  // A control block cut short, and a length word that is nonsense: no data.
  for (FortranInt words : {3, 0, -1}) {
    buffer[0] = words;
    back = Unpack(buffer, layout, true, 4, 1, true);
    for (const OBS& v : back) EXPECT_EQ(Bits(&v), missing) << words;
  }
}

// Random maps (not every variable mapped, empty runs, long runs, string keys
// inside key runs), random values of every awkward kind: packing matches
// the reference byte for byte, and unpacking restores every mapped variable
// bit for bit and leaves the others alone.
TEST(PackingRoundTrip, RandomMapsAgainstReference) {
  std::mt19937 random(TestSeed(20240601));
  const std::uint64_t missing = MissingBits();
  const std::uint64_t sentinel = 0xFFF7DEADBEEF0001ull;  // a signaling NaN
  for (int trial = 0; trial < 400; ++trial) {
    SCOPED_TRACE(trial);
    const FortranInt nvalues = trial % 50 == 0 ? 1000 + random() % 1200 : 1 + random() % 60;
    // Cut 1..nvalues into runs, shuffle them, drop a few, add empty ones.
    std::vector<Pair> runs;
    for (FortranInt v = 1; v <= nvalues;) {
      const FortranInt count =
          std::min<FortranInt>(nvalues - v + 1, 1 + random() % (trial % 50 == 0 ? 1100 : 6));
      runs.push_back({v, count});
      v += count;
    }
    std::shuffle(runs.begin(), runs.end(), random);
    if (runs.size() > 2 && random() % 3 == 0) runs.pop_back();
    if (random() % 4 == 0) runs.insert(runs.begin() + random() % (runs.size() + 1), Pair{1, 0});
    Layout layout;
    for (const Pair& p : runs) layout.AddRun(p.first, p.count);
    layout.nkeypairs = static_cast<FortranInt>(random() % (runs.size() + 1));

    std::vector<OBS> values(nvalues);
    for (OBS& v : values) {
      switch (random() % 10) {
        case 0:
          SetBits(&v, kSignalingNaN | (std::uint64_t{random()} << 20));
          break;
        case 1:
          SetBits(&v, kNegativeZero);
          break;
        case 2:
          SetBits(&v, kBlanks);
          break;
        case 3:
          SetBits(&v, missing);
          break;
        case 4:
          SetDouble(&v, static_cast<int>(random() % 300) - 140);
          break;
        case 5:
          SetText(&v, std::string(1 + random() % 8, static_cast<char>('a' + random() % 26)), 8);
          break;
        case 6:
          SetBits(&v, 0);
          break;
        default:
          SetBits(&v, (std::uint64_t{random()} << 32) | random());
          break;
      }
    }
    // String keys: fields in key runs, at most one per value so they never
    // overlap, holding blank-padded text without 0 bytes.
    FortranInt position = 1;  // packed position of the run's first value (header is 0)
    for (FortranInt p = 0; p < layout.nkeypairs; ++p) {
      const Pair run{layout.map[2 * p], layout.map[2 * p + 1]};
      for (FortranInt i = 0; i < run.count;) {
        const FortranInt room = run.count - i;
        if (random() % 2 == 0) {
          const FortranInt width = 1 + random() % std::min<FortranInt>(8 * room, 20);
          std::string text(random() % (width + 1), 'x');
          for (char& ch : text) ch = static_cast<char>(0x21 + random() % 94);
          if (!text.empty() && random() % 4 == 0) text[random() % text.size()] = ' ';
          SetText(&values[run.first - 1 + i], text, static_cast<std::size_t>(width));
          layout.AddStringKey(position + i, width);
          i += (width + 7) / 8;
        } else {
          ++i;
        }
      }
      position += run.count;
    }

    for (bool compress : {false, true}) {
      std::vector<FortranInt> buffer;
      const FortranInt header1 = static_cast<FortranInt>(random());
      const std::vector<unsigned char> packed = Pack(values, layout, compress, header1, buffer);
      ASSERT_EQ(packed, ReferencePack(values, layout, compress, header1))
          << "compress " << compress;
      const std::vector<OBS> back =
          Unpack(buffer, layout, compress, values.size(), sentinel, trial % 2);
      std::vector<bool> mapped(nvalues, false);
      for (const Pair& p : runs) {
        for (FortranInt i = 0; i < p.count; ++i) mapped[p.first - 1 + i] = true;
      }
      for (FortranInt v = 0; v < nvalues; ++v) {
        ASSERT_EQ(Bits(&back[v]), mapped[v] ? Bits(&values[v]) : sentinel) << "variable " << v + 1;
      }
      // Unpacking restored the string keys inside the packed record too.
      const std::vector<unsigned char> restored =
          ReferencePack(values, Layout{layout.map, layout.nkeypairs}, compress, header1);
      ASSERT_EQ(0, std::memcmp(buffer.data(), restored.data(), restored.size()));
    }
  }
}

}  // namespace
