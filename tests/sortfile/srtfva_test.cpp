// SRTFVA: the packing map and key descriptor list, checked against a
// reference built from the set of key-covered variables; and the whole
// chain SRTFVA -> SRTFPK -> SORTFILE -> SRTFUP against a stable sort of the
// original cases.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "sortfile_testing.h"

namespace {

using namespace sortfile_testing;

constexpr FortranInt kUntouched = -77777;

struct Key {
  FortranInt variable;
  FortranInt direction;
  FortranInt width;
};

std::vector<FortranInt> KeyArray(const std::vector<Key>& keys) {
  const std::size_t n = keys.size();
  std::vector<FortranInt> a(3 * n);
  for (std::size_t i = 0; i < n; ++i) {
    a[i] = keys[i].variable;
    a[n + i] = keys[i].direction;
    a[2 * n + i] = keys[i].width;
  }
  return a;
}

struct Result {
  FortranInt code = -1;
  FortranInt nmap = kUntouched, nkeypairs = kUntouched, keylength = kUntouched;
  std::vector<FortranInt> keys;  // 3 * (n + 1) values
  std::vector<FortranInt> map;   // room for 2 * (widraw + 1) values
};

Result CallSrtfva(const std::vector<Key>& keys, FortranInt widraw, FortranInt pack, FortranInt fill,
                  FortranInt n = kUntouched) {
  Result r;
  const std::vector<FortranInt> ukeys = KeyArray(keys);
  if (n == kUntouched) n = static_cast<FortranInt>(keys.size());
  r.keys.assign(3 * (keys.size() + 1), kUntouched);
  r.map.assign(2 * (std::max<FortranInt>(widraw, 0) + 2), kUntouched);
  r.code = SRTFVA(&n, ukeys.data(), r.keys.data(), r.map.data(), &r.nmap, &r.nkeypairs,
                  &r.keylength, &widraw, &pack, &fill);
  return r;
}

FortranInt Span(FortranInt width) { return (width - 1) / 8 + 1; }

// What SRTFVA must give for valid keys, from first principles: the key runs
// are the maximal runs of covered variables, the gaps those of the others;
// a key's offset is 1 + the number of covered variables before it.
Result Reference(const std::vector<Key>& keys, FortranInt widraw) {
  Result r;
  std::vector<bool> covered(widraw + 2, false);
  for (const Key& k : keys) {
    for (FortranInt v = k.variable; v < k.variable + Span(k.width); ++v) covered[v] = true;
  }
  std::vector<FortranInt> gaps;
  r.nkeypairs = 0;
  r.keylength = 0;
  for (FortranInt v = 1; v <= widraw;) {
    FortranInt end = v;
    while (end <= widraw && covered[end] == covered[v]) ++end;
    std::vector<FortranInt>& to = covered[v] ? r.map : gaps;
    to.push_back(v);
    to.push_back(end - v);
    if (covered[v]) {
      ++r.nkeypairs;
      r.keylength += end - v;
    }
    v = end;
  }
  r.map.insert(r.map.end(), gaps.begin(), gaps.end());
  r.nmap = static_cast<FortranInt>(r.map.size() / 2);
  for (const Key& k : keys) {
    FortranInt before = 0;
    for (FortranInt v = 1; v < k.variable; ++v) before += covered[v];
    r.keys.insert(r.keys.end(), {1 + before, k.width, k.direction});
  }
  r.keys.insert(r.keys.end(), {1, -1, 1});
  return r;
}

void ExpectMatchesReference(const std::vector<Key>& keys, FortranInt widraw) {
  const Result ref = Reference(keys, widraw);
  const Result sizes = CallSrtfva(keys, widraw, 1, 0);
  const Result got = CallSrtfva(keys, widraw, 1, 1);
  ASSERT_EQ(got.code, 0);
  EXPECT_EQ(sizes.code, 0);
  EXPECT_EQ(got.nmap, ref.nmap);
  EXPECT_EQ(got.nkeypairs, ref.nkeypairs);
  EXPECT_EQ(got.keylength, ref.keylength);
  EXPECT_EQ(sizes.nmap, ref.nmap);
  EXPECT_EQ(sizes.nkeypairs, ref.nkeypairs);
  EXPECT_EQ(sizes.keylength, ref.keylength);
  EXPECT_EQ(std::vector<FortranInt>(got.map.begin(), got.map.begin() + 2 * ref.nmap), ref.map);
  EXPECT_EQ(got.map[2 * ref.nmap], kUntouched);
  EXPECT_EQ(got.keys, ref.keys);
  // With filling off, neither array is written.
  for (FortranInt v : sizes.map) EXPECT_EQ(v, kUntouched);
  for (FortranInt v : sizes.keys) EXPECT_EQ(v, kUntouched);
}

class SrtfvaTest : public ::testing::Test {
 protected:
  // A consistency check that fails would be reported; none may be.
  void TearDown() override { EXPECT_TRUE(reports.Reports().empty()); }
  ReportCapture reports;
};

TEST_F(SrtfvaTest, WorkedExample) {
  const std::vector<Key> keys = {{5, 1, 0}, {2, -1, 12}, {6, 1, 0}};
  const Result r = CallSrtfva(keys, 10, 1, 1);
  EXPECT_EQ(r.code, 0);
  EXPECT_EQ(r.nmap, 5);
  EXPECT_EQ(r.nkeypairs, 2);
  EXPECT_EQ(r.keylength, 4);
  EXPECT_EQ(std::vector<FortranInt>(r.map.begin(), r.map.begin() + 10),
            (std::vector<FortranInt>{2, 2, 5, 2, 1, 1, 4, 1, 7, 4}));
  EXPECT_EQ(r.keys, (std::vector<FortranInt>{3, 0, 1, 1, 12, -1, 4, 0, 1, 1, -1, 1}));
}

TEST_F(SrtfvaTest, RunsJoinAndShare) {
  // Adjacent keys form one run; keys on one variable share its offset.
  Result r = CallSrtfva({{3, 1, 0}, {4, 1, 0}}, 6, 1, 1);
  EXPECT_EQ(r.nkeypairs, 1);
  EXPECT_EQ(r.map[0], 3);
  EXPECT_EQ(r.map[1], 2);
  r = CallSrtfva({{4, 1, 0}, {2, -1, 16}, {4, -1, 8}}, 6, 1, 1);
  EXPECT_EQ(r.keys[0], r.keys[6]);
  ExpectMatchesReference({{4, 1, 0}, {2, -1, 16}, {4, -1, 8}}, 6);
  // A key reaching into the next run's start joins it and extends it.
  ExpectMatchesReference({{7, 1, 0}, {2, 1, 0}, {3, 1, 40}}, 12);
}

TEST_F(SrtfvaTest, LeadingAndTrailingGaps) {
  Result r = CallSrtfva({{1, 1, 0}}, 5, 1, 1);
  EXPECT_EQ(r.nmap, 2);
  EXPECT_EQ(std::vector<FortranInt>(r.map.begin(), r.map.begin() + 4),
            (std::vector<FortranInt>{1, 1, 2, 4}));
  r = CallSrtfva({{4, 1, 9}}, 5, 1, 1);
  EXPECT_EQ(r.nmap, 2);
  EXPECT_EQ(std::vector<FortranInt>(r.map.begin(), r.map.begin() + 4),
            (std::vector<FortranInt>{4, 2, 1, 3}));
  r = CallSrtfva({{1, 1, 0}}, 1, 1, 1);
  EXPECT_EQ(r.nmap, 1);
  EXPECT_EQ(r.nkeypairs, 1);
  EXPECT_EQ(r.keylength, 1);
  EXPECT_EQ(r.map[0], 1);
  EXPECT_EQ(r.map[1], 1);
}

TEST_F(SrtfvaTest, NoKeys) {
  const Result r = CallSrtfva({}, 7, 1, 1);
  EXPECT_EQ(r.code, 0);
  EXPECT_EQ(r.nmap, 1);
  EXPECT_EQ(r.nkeypairs, 0);
  EXPECT_EQ(r.keylength, 0);
  EXPECT_EQ(r.map[0], 1);
  EXPECT_EQ(r.map[1], 7);
  EXPECT_EQ(r.keys, (std::vector<FortranInt>{1, -1, 1}));
}

TEST_F(SrtfvaTest, InvalidKeysLeaveArraysUntouched) {
  const std::vector<std::vector<Key>> invalid = {
      {{10, 1, 9}},                         // a 9-byte string on the last variable needs two
      {{0, 1, 0}},                          // variable below 1
      {{11, 1, 0}},                         // past the case
      {{2, 0, 0}},                          // direction 0 (SORTFILE would take it)
      {{2, 2, 0}},                          // direction 2
      {{2, 1, -1}},                         // negative width
      {{2, 1, 0}, {3, 1, 0}, {9, -1, 17}},  // only the last key is bad
  };
  for (const auto& keys : invalid) {
    for (FortranInt pack : {0, 1}) {
      const Result r = CallSrtfva(keys, 10, pack, 1);
      EXPECT_EQ(r.code, 10);
      EXPECT_EQ(r.nmap, 0);
      EXPECT_EQ(r.nkeypairs, 0);
      EXPECT_EQ(r.keylength, 0);
      for (FortranInt v : r.map) EXPECT_EQ(v, kUntouched);
      for (FortranInt v : r.keys) EXPECT_EQ(v, kUntouched);
    }
  }
  // A negative key count is refused the same way.
  const Result r = CallSrtfva({{2, 1, 0}}, 10, 1, 1, -2);
  EXPECT_EQ(r.code, 10);
  EXPECT_EQ(r.nmap, 0);
  for (FortranInt v : r.keys) EXPECT_EQ(v, kUntouched);
}

TEST_F(SrtfvaTest, PackOffCopiesTheKeys) {
  const std::vector<Key> keys = {{5, 1, 0}, {2, -1, 12}};
  Result r = CallSrtfva(keys, 10, 2, 3);  // bit 0 of pack clear, of fill set
  EXPECT_EQ(r.code, 0);
  EXPECT_EQ(r.nmap, 0);
  EXPECT_EQ(r.nkeypairs, 0);
  EXPECT_EQ(r.keylength, 0);
  EXPECT_EQ(r.keys, (std::vector<FortranInt>{5, 0, 1, 2, 12, -1, 1, -1, 1}));
  for (FortranInt v : r.map) EXPECT_EQ(v, kUntouched);
  r = CallSrtfva(keys, 10, 0, 0);
  for (FortranInt v : r.keys) EXPECT_EQ(v, kUntouched);
}

// Any number of keys, in any order, overlapping or not.
TEST_F(SrtfvaTest, RandomKeySetsMatchReference) {
  std::mt19937 random(TestSeed(77));
  for (int trial = 0; trial < 300; ++trial) {
    SCOPED_TRACE(trial);
    const FortranInt widraw = 1 + random() % (trial < 100 ? 20 : 400);
    const std::size_t n = trial < 100 ? random() % 8 : 65 + random() % 200;
    std::vector<Key> keys;
    for (std::size_t i = 0; i < n; ++i) {
      const FortranInt width = random() % 2 ? 0 : 1 + random() % 30;
      const FortranInt span = Span(width);
      if (span > widraw) continue;
      keys.push_back({static_cast<FortranInt>(1 + random() % (widraw - span + 1)),
                      random() % 2 ? 1 : -1, width});
    }
    ExpectMatchesReference(keys, widraw);
  }
}

// No state shared between calls: concurrent calls with different keys.
TEST_F(SrtfvaTest, ConcurrentCallsAgree) {
  std::vector<std::thread> threads;
  std::vector<int> failures(4, 0);
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([t, &failures]() {
      std::mt19937 random(1000 + t);
      for (int trial = 0; trial < 300; ++trial) {
        const FortranInt widraw = 100 + random() % 100;
        std::vector<Key> keys;
        for (int i = 0; i < 80; ++i) {
          keys.push_back({static_cast<FortranInt>(1 + random() % widraw), 1, 0});
        }
        const Result ref = Reference(keys, widraw);
        const Result got = CallSrtfva(keys, widraw, 1, 1);
        if (got.keys != ref.keys || got.nmap != ref.nmap) ++failures[t];
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(failures, std::vector<int>(4, 0));
}

// ---- the whole chain

struct Case {
  std::vector<OBS> values;
};

// Sorts `cases` by `keys` the straightforward way: numeric keys as doubles,
// string keys by unsigned bytes over their width, ties in input order.
std::vector<OBS> OracleSort(const std::vector<OBS>& cases, FortranInt widraw,
                            const std::vector<Key>& keys) {
  const std::size_t n = cases.size() / widraw;
  std::vector<std::size_t> order(n);
  for (std::size_t i = 0; i < n; ++i) order[i] = i;
  std::stable_sort(order.begin(), order.end(), [&](std::size_t a, std::size_t b) {
    const OBS* x = &cases[a * widraw];
    const OBS* y = &cases[b * widraw];
    for (const Key& k : keys) {
      int c;
      if (k.width == 0) {
        double u, v;
        std::memcpy(&u, x + k.variable - 1, 8);
        std::memcpy(&v, y + k.variable - 1, 8);
        c = u < v ? -1 : u > v ? 1 : 0;
      } else {
        c = std::memcmp(x + k.variable - 1, y + k.variable - 1, k.width);
        c = c < 0 ? -1 : c > 0 ? 1 : 0;
      }
      if (c != 0) return c * k.direction < 0;
    }
    return false;
  });
  std::vector<OBS> out;
  out.reserve(cases.size());
  for (std::size_t i : order) out.insert(out.end(), &cases[i * widraw], &cases[(i + 1) * widraw]);
  return out;
}

struct PackedSortContext {
  FortranInt width;  // OBS per packed record, header included
  const std::vector<OBS>* cases;
  FortranInt widraw;
  std::size_t next = 0;
  const Result* layout;
  FortranInt compress;
  std::vector<OBS> unpacked;
};

FortranInt VEXA_STDCALL PackedInput(void* context, OBS* buffer, FortranInt* nvars) {
  PackedSortContext& c = *static_cast<PackedSortContext*>(context);
  if (c.next * c.widraw >= c.cases->size()) return 1;
  std::memset(buffer, 0, sizeof(OBS) * *nvars);
  const FortranInt header1 = 0;
  SRTFPK(&(*c.cases)[c.next * c.widraw], reinterpret_cast<FortranInt*>(buffer), &header1,
         c.layout->map.data(), c.layout->keys.data(), &c.layout->nmap, &c.layout->nkeypairs,
         &c.compress);
  ++c.next;
  return 0;
}

FortranInt VEXA_STDCALL PackedOutput(void* context, const OBS* record, FortranInt* nvars) {
  PackedSortContext& c = *static_cast<PackedSortContext*>(context);
  std::vector<OBS> copy(record, record + *nvars);  // unpacking restores blanks in place
  const std::size_t at = c.unpacked.size();
  c.unpacked.resize(at + c.widraw);
  SRTFUP(reinterpret_cast<FortranInt*>(copy.data()), &c.unpacked[at], c.layout->map.data(),
         c.layout->keys.data(), &c.layout->nmap, &c.layout->nkeypairs, &c.compress);
  return 0;
}

// Cases packed with SRTFVA's map, sorted through SORTFILE on the key triples
// SRTFVA returned, and unpacked, come out exactly as a stable sort of the
// cases themselves. String keys hold text of bytes above the blank, so
// ending a key's text with a 0 byte in the packed form keeps its order.
void RunChain(std::size_t records, std::uint32_t seed, bool compress) {
  std::mt19937 random(seed);
  const FortranInt widraw = 14;
  // Keys: a descending numeric key with many ties, a 12-byte string (two
  // values), an ascending numeric key, and a short string key; others rest.
  const std::vector<Key> keys = {{9, -1, 0}, {2, 1, 12}, {6, 1, 0}, {12, -1, 3}};
  std::vector<OBS> cases(records * widraw);
  const char alphabet[] = "ABC ";
  for (std::size_t r = 0; r < records; ++r) {
    OBS* c = &cases[r * widraw];
    for (FortranInt v = 0; v < widraw; ++v)
      SetBits(c + v, (std::uint64_t{random()} << 32) | random());
    SetDouble(c + 8, static_cast<double>(random() % 5) - 2.0);
    SetDouble(c + 5, static_cast<double>(random() % 3) * 0.5);
    std::string text(random() % 13, ' ');
    for (char& ch : text) ch = alphabet[random() % 4];
    SetText(c + 1, text, 12);
    SetText(c + 11, std::string(random() % 4, alphabet[random() % 3]), 3);
    SetText(c + 4, "", 8);                            // eight blanks: code 254
    SetDouble(c + 13, static_cast<double>(r % 300));  // small integers: codes 1-251
  }

  Result sizes = CallSrtfva(keys, widraw, 1, 0);
  ASSERT_EQ(sizes.code, 0);
  Result layout = CallSrtfva(keys, widraw, 1, 1);
  ASSERT_EQ(layout.code, 0);
  ASSERT_EQ(layout.nmap, sizes.nmap);

  PackedSortContext context;
  const FortranInt rest = widraw - layout.keylength;
  context.width = 1 + layout.keylength + rest + (compress ? (rest + 7) / 8 : 0);
  context.cases = &cases;
  context.widraw = widraw;
  context.layout = &layout;
  context.compress = compress ? 1 : 0;

  std::vector<Key> packedKeys;
  for (std::size_t i = 0; i < keys.size(); ++i) {
    packedKeys.push_back({layout.keys[3 * i] + 1, layout.keys[3 * i + 2], layout.keys[3 * i + 1]});
  }
  const std::vector<FortranInt> ukeys = KeyArray(packedKeys);
  const FortranInt nukeys = static_cast<FortranInt>(packedKeys.size());
  FortranInt a10 = 1, a11 = 1;
  ASSERT_EQ(SORTFILE(&context, PackedInput, PackedOutput, &context.width, ukeys.data(), &nukeys,
                     nullptr, nullptr, nullptr, &a10, &a11),
            0);
  const std::vector<OBS> expected = OracleSort(cases, widraw, keys);
  ASSERT_EQ(context.unpacked.size(), expected.size());
  for (std::size_t i = 0; i < expected.size(); ++i) {
    ASSERT_EQ(Bits(&context.unpacked[i]), Bits(&expected[i])) << "record " << i / widraw;
  }
}

TEST_F(SrtfvaTest, ChainMatchesStableSortInMemory) {
  const std::uint32_t seed = TestSeed(4242);
  RunChain(5000, seed, true);
  RunChain(5000, seed + 1, false);
}

TEST_F(SrtfvaTest, ChainMatchesStableSortWithMerge) {
  PrivateTempDirectory temp;
  SmallBatches small;
  RunChain(250000, TestSeed(4343), true);
}

}  // namespace
