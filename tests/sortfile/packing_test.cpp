// SRTFPK, SRTFUP and SrtUnpack against a straightforward reference packer
// written from the record format, and round trips of awkward bit patterns.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "sortfile_testing.h"

namespace {

using namespace sortfile_testing;

constexpr std::uint64_t kBlanks = 0x2020202020202020ull;
constexpr std::uint64_t kSignalingNaN = 0x7FF0000000000001ull;

std::uint64_t DoubleBits(double d) {
  OBS v;
  SetDouble(&v, d);
  return Bits(&v);
}

// The code of a value, read from the code table: the system-missing pattern,
// eight blanks, +0.0, the nonzero integers -99 to 151, or the value itself.
unsigned ReferenceCode(std::uint64_t bits, std::uint64_t missing) {
  if (bits == missing) return 255;
  if (bits == kBlanks) return 254;
  if (bits == 0) return 100;
  double d;
  std::memcpy(&d, &bits, sizeof d);
  if (d == std::floor(d) && d >= -99.0 && d <= 151.0 && d != 0.0) {
    return static_cast<unsigned>(d + 100.0);
  }
  return 253;
}

// A packing description: the map (key runs first), how many are key runs,
// and the key descriptor list with its closing triple.
struct Layout {
  std::vector<FortranInt> map;  // pairs
  FortranInt nkeypairs = 0;
  std::vector<FortranInt> keys = {1, -1, 1};  // triples; closed

  FortranInt Pairs() const { return static_cast<FortranInt>(map.size() / 2); }
  void AddRun(FortranInt first, FortranInt count) { map.insert(map.end(), {first, count}); }
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
      codes.push_back(static_cast<unsigned char>(ReferenceCode(Bits(v), MissingBits())));
      if (codes.back() == 253) literals.push_back(v);
    }
  }
  if (!codes.empty()) flush();
  const FortranInt header[2] = {static_cast<FortranInt>(out.size() / 4), header1};
  std::memcpy(out.data(), header, sizeof header);
  for (std::size_t k = 0; layout.keys[3 * k + 1] >= 0; ++k) {
    const std::size_t at = static_cast<std::size_t>(layout.keys[3 * k]) * 8;
    std::size_t end = static_cast<std::size_t>(layout.keys[3 * k + 1]);
    if (end == 0 || out[at + end - 1] != ' ') continue;
    while (end > 0 && out[at + end - 1] == ' ') --end;
    out[at + end] = 0;
  }
  return out;
}

// Packs into `buffer` (resized with room to spare) and returns the record's
// bytes as far as its length word says.
std::vector<unsigned char> Pack(const std::vector<OBS>& values, const Layout& layout, bool compress,
                                FortranInt header1, std::vector<FortranInt>& buffer) {
  buffer.assign(6 + 2 * values.size() + 2 * ((values.size() + 7) / 8), 0x5A5A5A5A);
  const FortranInt nmap = layout.Pairs(), c = compress ? 1 : 0;
  SRTFPK(values.data(), buffer.data(), &header1, layout.map.data(), layout.keys.data(), &nmap,
         &layout.nkeypairs, &c);
  const unsigned char* b = reinterpret_cast<const unsigned char*>(buffer.data());
  return std::vector<unsigned char>(b, b + 4 * static_cast<std::size_t>(buffer[0]));
}

// Unpacks through SRTFUP, or SrtUnpack when `plainC`, into values preset to `sentinel`.
std::vector<OBS> Unpack(std::vector<FortranInt>& buffer, const Layout& layout, bool compress,
                        std::size_t nvalues, std::uint64_t sentinel, bool plainC) {
  std::vector<OBS> out(nvalues);
  for (OBS& v : out) SetBits(&v, sentinel);
  const FortranInt nmap = layout.Pairs(), c = compress ? 1 : 0;
  if (plainC) {
    SrtUnpack(reinterpret_cast<OBS*>(buffer.data() + 2), out.data(), layout.map.data(),
              layout.keys.data(), nmap, layout.nkeypairs, compress);
  } else {
    SRTFUP(buffer.data(), out.data(), layout.map.data(), layout.keys.data(), &nmap,
           &layout.nkeypairs, &c);
  }
  return out;
}

// The format spelled out once, independently of the reference packer: the
// length word and header word 1; the key run, where string keys end at a 0
// byte where their trailing blanks began (an empty text at once, a full one
// not at all, a 12-byte key spans two values) and a numeric key is left
// alone; then a full control block of eight codes (+0.0, the ends of the
// integer range, blanks, missing, values kept whole) with its literals, and
// a second block for the ninth value. Unpacking restores the blanks.
TEST(Packing, RecordByteByByte) {
  std::vector<OBS> values(14);
  SetText(&values[0], "AB", 8);
  SetText(&values[1], "", 8);
  SetText(&values[2], "ABCDEFGH", 8);
  SetText(&values[3], "HELLO", 16);
  const double numbers[] = {0.0, -99.0, 151.0, 128.0, 0, 0, -100.0, 152.0, 0.5};
  for (int i = 0; i < 9; ++i) SetDouble(&values[5 + i], numbers[i]);
  SetBits(&values[9], kBlanks);
  SetBits(&values[10], MissingBits());
  Layout layout;
  layout.AddRun(1, 5);
  layout.AddRun(6, 9);
  layout.nkeypairs = 1;
  for (FortranInt k = 1; k <= 4; ++k) layout.AddStringKey(k, k == 4 ? 12 : 8);
  layout.keys.insert(layout.keys.end() - 3, {5, 0, -1});
  std::vector<FortranInt> buffer;
  const std::vector<unsigned char> packed = Pack(values, layout, true, 77, buffer);
  EXPECT_EQ(buffer[0], 2 * 11);
  EXPECT_EQ(buffer[1], 77);
  auto bytes = [&](int i) { return std::string(reinterpret_cast<const char*>(&values[i]), 8); };
  EXPECT_EQ(std::string(packed.begin() + 8, packed.end()),
            std::string("AB\0     \0       ABCDEFGHHELLO\0", 30) + std::string(10, ' ') +
                "\x64\x01\xFB\xE4\xFE\xFF\xFD\xFD" + bytes(11) + bytes(12) +
                std::string("\xFD\0\0\0\0\0\0\0", 8) + bytes(13));
  EXPECT_TRUE(SameBits(Unpack(buffer, layout, true, 14, 1, false), values));
}

// Damaged compressed records: undefined codes and a length word that ends
// the record early give system-missing values; nothing past the length is read.
TEST(Packing, UndefinedCodesAndShortRecordsGiveMissing) {
  const std::uint64_t missing = MissingBits(), one = DoubleBits(1.0);
  Layout layout;
  layout.AddRun(1, 4);
  // Header, one control block, one literal, then bytes that must not be read.
  std::vector<FortranInt> buffer(8);
  unsigned char* bytes = reinterpret_cast<unsigned char*>(buffer.data());
  const unsigned char control[8] = {101, 0, 252, 253, 0, 0, 0, 0};
  std::memcpy(bytes + 8, control, 8);
  const std::uint64_t literal = DoubleBits(2.5), beyond = DoubleBits(-7.25);
  std::memcpy(bytes + 16, &literal, 8);
  std::memcpy(bytes + 24, &beyond, 8);
  auto expect = [&](FortranInt words, std::vector<std::uint64_t> bits) {
    SCOPED_TRACE(words);
    buffer[0] = words;
    const std::vector<OBS> back = Unpack(buffer, layout, true, 4, 1, true);
    for (std::size_t i = 0; i < 4; ++i) EXPECT_EQ(Bits(&back[i]), bits[i]) << i;
  };
  expect(6, {one, missing, missing, literal});  // header, control block and the literal
  expect(4, {one, missing, missing, missing});  // the literal lies past the length
  // A control block cut short, and a length word that is nonsense: no data.
  for (FortranInt words : {3, 0, -1}) expect(words, {missing, missing, missing, missing});
  // A literal cut short by the length, then values coded in the control block.
  const unsigned char literalFirst[8] = {253, 101, 102, 103, 0, 0, 0, 0};
  std::memcpy(bytes + 8, literalFirst, 8);
  expect(5, {missing, one, DoubleBits(2.0), DoubleBits(3.0)});
}

// Random maps (not every variable mapped, empty runs, string keys inside key
// runs; in large trials runs of 999, 1000 and 1001 values, on both sides of
// the length from which runs are copied by block move), random values of
// every awkward kind: packing matches the reference byte for byte, and
// unpacking restores every mapped variable bit for bit, leaves the others
// alone and restores the packed string keys.
TEST(Packing, RandomMapsRoundTripAgainstReference) {
  std::mt19937 random(TestSeed(20240601));
  const std::uint64_t sentinel = 0xFFF7DEADBEEF0001ull;  // a signaling NaN
  // NaNs (signaling, with a payload, quiet), -0.0, blanks, missing, +0.0, a
  // denormal, infinity, just above 1.0; numbers next to coded integers.
  const std::uint64_t awkwardBits[] = {
      0x7FF0000000000001ull, 0x7FF00005A5A00000ull, 0x7FF8000000000000ull, 0x8000000000000000ull,
      0x2020202020202020ull, 0x0000000000000000ull, 0x0000000000000001ull, 0x7FF0000000000000ull,
      0x3FF0000000000001ull, MissingBits()};
  const double awkwardNumbers[] = {0.5, 1e10, -98.5, 150.75, 1e-300, -100.0, 152.0};
  for (int trial = 0; trial < 400; ++trial) {
    SCOPED_TRACE(trial);
    const bool large = trial % 50 == 0;
    const FortranInt nvalues = large ? 3000 + random() % 1200 : 1 + random() % 60;
    // Cut 1..nvalues into runs, shuffle them, drop a few, add empty ones.
    std::vector<std::pair<FortranInt, FortranInt>> runs;  // (first, count)
    for (FortranInt v = 1; v <= nvalues; v += runs.back().second) {
      const FortranInt count = large && runs.size() < 3 ? 999 + static_cast<FortranInt>(runs.size())
                                                        : 1 + random() % (large ? 1100 : 6);
      runs.emplace_back(v, std::min<FortranInt>(nvalues - v + 1, count));
    }
    std::shuffle(runs.begin(), runs.end(), random);
    if (runs.size() > 2 && random() % 3 == 0) runs.pop_back();
    if (random() % 4 == 0) runs.emplace(runs.begin() + random() % (runs.size() + 1), 1, 0);
    Layout layout;
    for (const auto& run : runs) layout.AddRun(run.first, run.second);
    layout.nkeypairs = static_cast<FortranInt>(random() % (runs.size() + 1));

    std::vector<OBS> values(nvalues);
    for (OBS& v : values) {
      switch (random() % 5) {
        case 0:
          SetBits(&v, awkwardBits[random() % 10]);
          break;
        case 1:
          SetDouble(&v, awkwardNumbers[random() % 7]);
          break;
        case 2:  // around the integers that have codes
          SetDouble(&v, static_cast<int>(random() % 255) - 101);
          break;
        case 3:
          SetText(&v, std::string(1 + random() % 8, static_cast<char>('a' + random() % 26)), 8);
          break;
        default:
          SetBits(&v, (std::uint64_t{random()} << 32) | random());
      }
    }
    // String keys: fields in key runs, at most one per value so they never
    // overlap, holding blank-padded text without 0 bytes.
    FortranInt position = 1;  // packed position of the run's first value (header is 0)
    for (FortranInt p = 0; p < layout.nkeypairs; ++p) {
      const FortranInt first = layout.map[2 * p], count = layout.map[2 * p + 1];
      for (FortranInt i = 0; i < count;) {
        if (random() % 2) {
          ++i;
          continue;
        }
        const FortranInt width = 1 + random() % std::min<FortranInt>(8 * (count - i), 20);
        std::string text(random() % (width + 1), 'x');
        for (char& ch : text) ch = static_cast<char>(0x21 + random() % 94);
        if (!text.empty() && random() % 4 == 0) text[random() % text.size()] = ' ';
        SetText(&values[first - 1 + i], text, static_cast<std::size_t>(width));
        layout.AddStringKey(position + i, width);
        i += (width + 7) / 8;
      }
      position += count;
    }
    // Any negative width closes the list; what follows is never read.
    layout.keys[layout.keys.size() - 2] = -static_cast<FortranInt>(1 + random() % 5);
    layout.keys.insert(layout.keys.end(), {1, 8, 1});

    for (bool compress : {false, true}) {
      Layout used = layout;
      if (!compress) used.nkeypairs = 1 << 20;  // not read without compression
      std::vector<FortranInt> buffer;
      const FortranInt header1 = static_cast<FortranInt>(random());
      ASSERT_EQ(Pack(values, used, compress, header1, buffer),
                ReferencePack(values, used, compress, header1))
          << "compress " << compress;
      const std::vector<OBS> back =
          Unpack(buffer, used, compress, values.size(), sentinel, random() % 2);
      std::vector<bool> mapped(nvalues, false);
      for (const auto& run : runs) std::fill_n(mapped.begin() + run.first - 1, run.second, true);
      for (FortranInt v = 0; v < nvalues; ++v) {
        ASSERT_EQ(Bits(&back[v]), mapped[v] ? Bits(&values[v]) : sentinel) << "variable " << v + 1;
      }
      const std::vector<unsigned char> restored =
          ReferencePack(values, Layout{used.map, used.nkeypairs}, compress, header1);
      ASSERT_EQ(0, std::memcmp(buffer.data(), restored.data(), restored.size()));
    }
  }
}

}  // namespace
