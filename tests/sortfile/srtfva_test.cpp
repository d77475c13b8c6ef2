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

struct Result {
  FortranInt code = -1;
  FortranInt nmap = kUntouched, nkeypairs = kUntouched, keylength = kUntouched;
  std::vector<FortranInt> keys;  // 3 * (n + 1) values
  std::vector<FortranInt> map;   // room for 2 * (widraw + 2) values
  std::vector<FortranInt> Counts() const { return {nmap, nkeypairs, keylength}; }
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

bool AllUntouched(const std::vector<FortranInt>& v) {
  return std::all_of(v.begin(), v.end(), [](FortranInt x) { return x == kUntouched; });
}

// What SRTFVA must give for valid keys, from first principles: the key runs
// are the maximal runs of covered variables, the gaps those of the others;
// a key's offset is 1 + the number of covered variables before it.
Result Reference(const std::vector<Key>& keys, FortranInt widraw) {
  Result r;
  std::vector<bool> covered(widraw + 2, false);
  for (const Key& k : keys) {
    for (FortranInt v = k.variable; v < k.variable + (k.width - 1) / 8 + 1; ++v) covered[v] = true;
  }
  std::vector<FortranInt> gaps;
  r.nkeypairs = 0;
  r.keylength = 0;
  for (FortranInt v = 1; v <= widraw;) {
    FortranInt end = v;
    while (end <= widraw && covered[end] == covered[v]) ++end;
    std::vector<FortranInt>& to = covered[v] ? r.map : gaps;
    to.insert(to.end(), {v, end - v});
    if (covered[v]) {
      ++r.nkeypairs;
      r.keylength += end - v;
    }
    v = end;
  }
  r.map.insert(r.map.end(), gaps.begin(), gaps.end());
  r.nmap = static_cast<FortranInt>(r.map.size() / 2);
  for (const Key& k : keys) {
    const FortranInt before = static_cast<FortranInt>(
        std::count(covered.begin() + 1, covered.begin() + k.variable, true));
    r.keys.insert(r.keys.end(), {1 + before, k.width, k.direction});
  }
  r.keys.insert(r.keys.end(), {1, -1, 1});
  return r;
}

// Sizing (fill off) and filling agree with the reference and write nothing
// else; with bit 0 of pack clear, the triples are the keys as given.
void ExpectMatchesReference(const std::vector<Key>& keys, FortranInt widraw) {
  const Result ref = Reference(keys, widraw);
  for (FortranInt fill : {0, 1}) {
    SCOPED_TRACE(fill);
    const Result got = CallSrtfva(keys, widraw, 1, fill);
    ASSERT_EQ(got.code, 0);
    EXPECT_EQ(got.Counts(), ref.Counts());
    if (fill) {
      EXPECT_EQ(std::vector<FortranInt>(got.map.begin(), got.map.begin() + 2 * ref.nmap), ref.map);
      EXPECT_EQ(got.map[2 * ref.nmap], kUntouched);
      EXPECT_EQ(got.keys, ref.keys);
    } else {
      EXPECT_TRUE(AllUntouched(got.map) && AllUntouched(got.keys));
    }
  }
  const Result off = CallSrtfva(keys, widraw, 2, 3);
  std::vector<FortranInt> copied;
  for (const Key& k : keys) copied.insert(copied.end(), {k.variable, k.width, k.direction});
  copied.insert(copied.end(), {1, -1, 1});
  EXPECT_EQ(off.code, 0);
  EXPECT_EQ(off.Counts(), std::vector<FortranInt>(3, 0));
  EXPECT_EQ(off.keys, copied);
  EXPECT_TRUE(AllUntouched(off.map));
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
  EXPECT_EQ(r.Counts(), (std::vector<FortranInt>{5, 2, 4}));
  EXPECT_EQ(std::vector<FortranInt>(r.map.begin(), r.map.begin() + 10),
            (std::vector<FortranInt>{2, 2, 5, 2, 1, 1, 4, 1, 7, 4}));
  EXPECT_EQ(r.keys, (std::vector<FortranInt>{3, 0, 1, 1, 12, -1, 4, 0, 1, 1, -1, 1}));
}

TEST_F(SrtfvaTest, InvalidKeysGiveTenAndLeaveArraysUntouched) {
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
      EXPECT_EQ(r.Counts(), std::vector<FortranInt>(3, 0));
      EXPECT_TRUE(AllUntouched(r.map) && AllUntouched(r.keys));
    }
  }
  const Result r = CallSrtfva({{2, 1, 0}}, 10, 1, 1, -2);  // a negative key count
  EXPECT_EQ(r.code, 10);
  EXPECT_EQ(r.Counts(), std::vector<FortranInt>(3, 0));
  EXPECT_TRUE(AllUntouched(r.map) && AllUntouched(r.keys));
}

// The edge cases (no keys, a key on the first or last variable, runs that
// join), then any number of keys in any order, overlapping or not, from four
// threads at once: calls share no state.
TEST_F(SrtfvaTest, KeySetsMatchReference) {
  ExpectMatchesReference({}, 7);
  ExpectMatchesReference({{1, 1, 0}}, 1);
  ExpectMatchesReference({{1, 1, 0}}, 5);
  ExpectMatchesReference({{4, 1, 9}}, 5);
  ExpectMatchesReference({{3, 1, 0}, {4, 1, 0}}, 6);
  ExpectMatchesReference({{4, 1, 0}, {2, -1, 16}, {4, -1, 8}}, 6);
  ExpectMatchesReference({{7, 1, 0}, {2, 1, 0}, {3, 1, 40}}, 12);
  const std::uint32_t seed = TestSeed(77);
  std::vector<std::thread> threads;
  for (std::uint32_t t = 0; t < 4; ++t) {
    threads.emplace_back([seed, t] {
      std::mt19937 random(seed + t);
      for (int trial = 0; trial < 100; ++trial) {
        SCOPED_TRACE(testing::Message() << "thread " << t << " trial " << trial);
        const FortranInt widraw = 1 + random() % (trial % 3 ? 400 : 20);
        const std::size_t n = trial % 3 ? 65 + random() % 200 : random() % 8;
        std::vector<Key> keys;
        for (std::size_t i = 0; i < n; ++i) {
          const FortranInt width = random() % 2 ? 0 : 1 + random() % 30;
          const FortranInt span = (width - 1) / 8 + 1;
          if (span > widraw) continue;
          keys.push_back({static_cast<FortranInt>(1 + random() % (widraw - span + 1)),
                          random() % 2 ? 1 : -1, width});
        }
        ExpectMatchesReference(keys, widraw);
      }
    });
  }
  for (std::thread& t : threads) t.join();
}

// A case width of 0 or below breaks the layout's consistency conditions;
// each failure is reported and the call goes on.
TEST(Srtfva, ConsistencyChecksAreReported) {
  ReportCapture reports;
  EXPECT_EQ(CallSrtfva({}, -1, 1, 1).code, 0);
  EXPECT_EQ(CallSrtfva({}, 0, 1, 1).code, 0);
  EXPECT_EQ(reports.Reports(), (std::vector<std::string>{"ASSERT in SRTFVA: NXTIN .EQ. WIDRAW+1",
                                                         "ASSERT in SRTFVA: OUTPOS .EQ. WIDRAW+1",
                                                         "ASSERT in SRTFVA: JMAP .EQ. NMAP"}));
}

// ---- the whole chain

struct PackedSortContext {
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
  std::memset(buffer, 0, sizeof(OBS) * *nvars);  // the tail past the packed record
  const FortranInt header1 = 0;
  SRTFPK(&(*c.cases)[c.next++ * c.widraw], reinterpret_cast<FortranInt*>(buffer), &header1,
         c.layout->map.data(), c.layout->keys.data(), &c.layout->nmap, &c.layout->nkeypairs,
         &c.compress);
  return 0;
}

FortranInt VEXA_STDCALL PackedOutput(void* context, const OBS* record, FortranInt* nvars) {
  PackedSortContext& c = *static_cast<PackedSortContext*>(context);
  std::vector<OBS> copy(record, record + *nvars);  // unpacking restores blanks in place
  c.unpacked.resize(c.unpacked.size() + c.widraw);
  SRTFUP(reinterpret_cast<FortranInt*>(copy.data()), &c.unpacked[c.unpacked.size() - c.widraw],
         c.layout->map.data(), c.layout->keys.data(), &c.layout->nmap, &c.layout->nkeypairs,
         &c.compress);
  return 0;
}

// Cases packed with SRTFVA's map, sorted through SORTFILE on the key triples
// SRTFVA returned, and unpacked, come out exactly as a stable sort of the
// cases themselves. String keys hold text of bytes above the blank, so
// ending a key's text with a 0 byte in the packed form keeps its order.
void RunChain(std::size_t records, std::uint32_t seed, bool compress) {
  std::mt19937 random(seed);
  const FortranInt widraw = 14;
  // A descending numeric key with many ties, a 12-byte string (two values),
  // an ascending numeric key, and a short string key; the rest random bits.
  const std::vector<Key> keys = {{9, -1, 0}, {2, 1, 12}, {6, 1, 0}, {12, -1, 3}};
  std::vector<OBS> cases(records * widraw);
  for (std::size_t r = 0; r < records; ++r) {
    OBS* c = &cases[r * widraw];
    for (FortranInt v = 0; v < widraw; ++v)
      SetBits(c + v, (std::uint64_t{random()} << 32) | random());
    SetDouble(c + 8, static_cast<double>(random() % 5) - 2.0);
    SetDouble(c + 5, static_cast<double>(random() % 3) * 0.5);
    std::string text(random() % 13, ' ');
    for (char& ch : text) ch = "ABC "[random() % 4];
    SetText(c + 1, text, 12);
    SetText(c + 11, std::string(random() % 4, "ABC"[random() % 3]), 3);
    SetText(c + 4, "", 8);                            // eight blanks: code 254
    SetDouble(c + 13, static_cast<double>(r % 300));  // small integers: codes 1-251
  }

  const Result layout = CallSrtfva(keys, widraw, 1, 1);
  ASSERT_EQ(layout.code, 0);
  FortranInt width = 1 + widraw + (compress ? (widraw - layout.keylength + 7) / 8 : 0);
  PackedSortContext context{&cases, widraw, 0, &layout, compress ? 1 : 0, {}};
  std::vector<Key> packedKeys;
  for (std::size_t i = 0; i < keys.size(); ++i) {
    packedKeys.push_back({layout.keys[3 * i] + 1, layout.keys[3 * i + 2], layout.keys[3 * i + 1]});
  }
  const std::vector<FortranInt> ukeys = KeyArray(packedKeys);
  const FortranInt nukeys = static_cast<FortranInt>(packedKeys.size());
  ASSERT_EQ(SORTFILE(&context, PackedInput, PackedOutput, &width, ukeys.data(), &nukeys, nullptr,
                     nullptr, nullptr, nullptr, nullptr),
            0);
  EXPECT_TRUE(SameBits(context.unpacked, OracleSort(cases, widraw, keys)));
}

TEST_F(SrtfvaTest, ChainMatchesStableSort) {
  const std::uint32_t seed = TestSeed(4242);
  RunChain(5000, seed, true);
  RunChain(5000, seed + 1, false);
  PrivateTempDirectory temp;
  SmallBatches small;  // runs on disk and a merge
  RunChain(250000, seed + 2, true);
}

}  // namespace
