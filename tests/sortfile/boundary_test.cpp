// What the 32-bit Windows target makes fragile at the Fortran-callable
// boundary: integers that must be 32 bits wherever a Fortran caller passes
// one, stdcall callbacks that must leave the stack as they found it, and
// values that must cross as bit patterns (an x87 register would quiet a
// signaling NaN hidden in string bytes).
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <random>
#include <vector>

#include "isort/sortfile.h"

static_assert(sizeof(FortranInt) == 4, "a Fortran INTEGER is 32 bits on every platform");

namespace {

struct Source {
  std::vector<std::vector<OBS>> in;
  std::vector<std::vector<OBS>> out;
  std::size_t next = 0;
  FortranInt nvars = 0;
  const void* frame = nullptr;  // the callbacks' frame, the same on every call
  bool frameMoved = false;
};

void CheckFrame(Source& s) {
  const void* here = __builtin_frame_address(0);
  if (s.frame && s.frame != here) s.frameMoved = true;
  s.frame = here;
}

FortranInt VEXA_STDCALL Input(void* context, OBS* buffer, FortranInt* nvars) {
  Source& s = *static_cast<Source*>(context);
  if (*nvars != s.nvars) return 99;
  if (s.next == s.in.size()) return 1;
  std::memcpy(buffer, s.in[s.next++].data(), sizeof(OBS) * static_cast<std::size_t>(*nvars));
  return 0;
}

FortranInt VEXA_STDCALL Output(void* context, const OBS* record, FortranInt* nvars) {
  Source& s = *static_cast<Source*>(context);
  CheckFrame(s);
  s.out.emplace_back(record, record + *nvars);
  return 0;
}

OBS Bits(std::uint64_t bits) {
  OBS v;
  std::memcpy(&v, &bits, sizeof v);
  return v;
}

}  // namespace

// The integers SORTFILE reads sit in arrays whose next word holds garbage:
// a reader of 64-bit integers would see nonsense widths and counts. The
// non-key values are signaling NaNs and string bytes that must come back
// bit for bit; the string key holds arbitrary bytes.
TEST(FortranBoundary, SortfileReadsIntegersAndMovesBitPatterns) {
  std::mt19937_64 rng(8);
  Source s;
  s.nvars = 4;
  for (int i = 0; i < 3000; ++i) {
    std::vector<OBS> r(4);
    std::uint64_t key = rng() | 0x0101010101010101ull;  // string bytes, no zero byte
    if (i % 7 == 0) key = 0x7FF0000000000001ull;        // also a signaling NaN pattern
    r[0] = Bits(key);
    r[1] = Bits(0x7FF0000000000001ull + (rng() % 1000));  // signaling NaNs
    r[2] = Bits(0xFFF4000000000000ull | (rng() & 0xFFFF));
    r[3] = static_cast<double>(i);
    s.in.push_back(r);
  }
  const FortranInt nvars[2] = {4, -1};
  const FortranInt nukeys[2] = {1, 0x7FFFFFFF};
  const FortranInt ukeys[4] = {1, 1, 8, -1};  // variable 1, ascending, width 8; then garbage
  FortranInt ten = 7, eleven = 7;
  const FortranInt code = SORTFILE(&s, Input, Output, nvars, ukeys, nukeys, nullptr, nullptr,
                                   nullptr, &ten, &eleven);
  ASSERT_EQ(code, 0);
  EXPECT_EQ(ten, 0);
  EXPECT_EQ(eleven, 0);
  EXPECT_FALSE(s.frameMoved) << "a callback left the stack changed: calling conventions differ";

  std::vector<std::vector<OBS>> expect = s.in;
  std::stable_sort(expect.begin(), expect.end(), [](const std::vector<OBS>& a, const std::vector<OBS>& b) {
    return std::memcmp(&a[0], &b[0], 8) < 0;
  });
  ASSERT_EQ(s.out.size(), expect.size());
  for (std::size_t i = 0; i < expect.size(); ++i) {
    ASSERT_EQ(0, std::memcmp(s.out[i].data(), expect[i].data(), 4 * sizeof(OBS))) << "record " << i;
  }
}

// The packed record's header and the map are 32-bit words; the round trip
// through SRTFPK and SRTFUP keeps every bit, compressed or not.
TEST(FortranBoundary, PackedRecordsUseThirtyTwoBitWords) {
  const FortranInt widraw = 5;
  std::vector<OBS> in(widraw);
  in[0] = 3.0;
  in[1] = Bits(0x7FF0000000000001ull);
  std::memcpy(&in[2], "AB      ", 8);
  in[3] = Bits(0xFFF1202020202020ull);  // string bytes that read as a signaling NaN
  in[4] = Bits(0x8000000000000000ull);
  // One key run (variable 1) and the rest; one numeric key at offset 1.
  const FortranInt map[4] = {1, 1, 2, 4};
  const FortranInt keys[6] = {1, 0, 1, 1, -1, 1};
  const FortranInt nmap = 2, nkeypairs = 1, header = 0x12345678;
  for (FortranInt compress : {0, 1}) {
    std::vector<FortranInt> packed(2 + 2 * 12, 0x5A5A5A5A);
    SRTFPK(in.data(), packed.data(), &header, map, keys, &nmap, &nkeypairs, &compress);
    if (!compress) {
      EXPECT_EQ(packed[0], 2 * (1 + widraw));  // words, header included
    }
    EXPECT_EQ(packed[1], header);
    std::vector<OBS> out(widraw, 0.0);
    SRTFUP(packed.data(), out.data(), map, keys, &nmap, &nkeypairs, &compress);
    EXPECT_EQ(0, std::memcmp(in.data(), out.data(), sizeof(OBS) * widraw)) << "compress " << compress;
  }
}
