// Key layout (split and join) and the record comparison.
#include <gtest/gtest.h>

#include <random>

#include "sort_harness.h"

using namespace testing_support;
using Segment = FileSort::KeyLayout::Segment;

namespace {

std::vector<std::pair<unsigned, unsigned>> Pairs(const std::vector<Segment>& s) {
  std::vector<std::pair<unsigned, unsigned>> out;
  for (const Segment& x : s) out.push_back({x.first, x.count});
  return out;
}

using PairList = std::vector<std::pair<unsigned, unsigned>>;

}  // namespace

TEST(KeyLayout, WorkedExample) {
  FileSort::KeyLayout layout({{3, 1, 0}, {5, -1, 20}, {0, 1, 8}}, 10);
  EXPECT_EQ(layout.keyValues, 5u);
  EXPECT_EQ(layout.restValues, 5u);
  EXPECT_EQ(Pairs(layout.keySegments), (PairList{{3, 1}, {5, 3}, {0, 1}}));
  EXPECT_EQ(Pairs(layout.restSegments), (PairList{{1, 2}, {4, 1}, {8, 2}}));

  OBS record[10], key[5], rest[5], back[10];
  for (int i = 0; i < 10; ++i) record[i] = i;
  layout.Split(record, key, rest);
  EXPECT_EQ(std::vector<OBS>(key, key + 5), (std::vector<OBS>{3, 5, 6, 7, 0}));
  EXPECT_EQ(std::vector<OBS>(rest, rest + 5), (std::vector<OBS>{1, 2, 4, 8, 9}));
  layout.Join(key, rest, back);
  EXPECT_EQ(0, std::memcmp(record, back, sizeof record));
}

TEST(KeyLayout, EdgeShapes) {
  // No keys: one rest segment, or none for an empty record.
  FileSort::KeyLayout none({}, 4);
  EXPECT_EQ(none.keyValues, 0u);
  EXPECT_EQ(Pairs(none.restSegments), (PairList{{0, 4}}));
  EXPECT_TRUE(FileSort::KeyLayout({}, 0).restSegments.empty());
  // Every value a key: no rest.
  FileSort::KeyLayout all({{0, 1, 16}, {2, 1, 0}}, 3);
  EXPECT_EQ(all.keyValues, 3u);
  EXPECT_EQ(all.restValues, 0u);
  EXPECT_TRUE(all.restSegments.empty());
  // Steps by width: 8 -> 1, 9 -> 2, 16 -> 2, 17 -> 3; numeric and 1..8 -> 1.
  for (auto [width, step] : PairList{{0, 1}, {1, 1}, {8, 1}, {9, 2}, {16, 2}, {17, 3}}) {
    FileSort::KeyLayout l({{0, 1, width}}, 3);
    EXPECT_EQ(l.keyValues, step) << "width " << width;
  }
  // Neighbouring keys stay two segments, in key order.
  FileSort::KeyLayout adjacent({{2, 1, 0}, {3, 1, 0}}, 5);
  EXPECT_EQ(Pairs(adjacent.keySegments), (PairList{{2, 1}, {3, 1}}));
  FileSort::KeyLayout backwards({{4, 1, 0}, {1, 1, 0}}, 5);
  OBS record[5] = {10, 11, 12, 13, 14}, key[2], rest[3], back[5];
  backwards.Split(record, key, rest);
  EXPECT_EQ(key[0], 14);
  EXPECT_EQ(key[1], 11);
  backwards.Join(key, rest, back);
  EXPECT_EQ(0, std::memcmp(record, back, sizeof record));
}

// Keys that repeat or overlap: the key part holds each key's own values, so
// it stays in line with the comparison, and Join restores every value.
TEST(KeyLayout, OverlappingKeysRoundTrip) {
  std::mt19937_64 rng(7);
  for (int trial = 0; trial < 200; ++trial) {
    const unsigned nvars = 1 + rng() % 12;
    std::vector<Key> keys;
    const int nkeys = rng() % 5;
    for (int k = 0; k < nkeys; ++k) {
      const unsigned v = rng() % nvars;
      const unsigned maxWidth = (nvars - v) * 8;
      keys.push_back({int(v), 1, static_cast<std::uint32_t>(rng() % (maxWidth + 1))});
    }
    FileSort::KeyLayout layout(keys, nvars);
    unsigned expectK = 0;
    for (const Key& k : keys) expectK += KeyStep(k.width);
    EXPECT_EQ(layout.keyValues, expectK);
    std::vector<OBS> record(nvars), key(layout.keyValues + 1), rest(layout.restValues + 1),
        back(nvars, 0.0);
    for (OBS& v : record) v = AwkwardValue(rng);
    layout.Split(record.data(), key.data(), rest.data());
    unsigned at = 0;
    for (const Key& k : keys) {  // key i's values sit at its own place in the key part
      EXPECT_EQ(0, std::memcmp(&key[at], &record[k.variable], KeyStep(k.width) * 8));
      at += KeyStep(k.width);
    }
    layout.Join(key.data(), rest.data(), back.data());
    EXPECT_TRUE(SameBits(record, back)) << "trial " << trial;
  }
}

TEST(KeyLayout, KeysOutsideTheRecordAreRejected) {
  struct Never : FileSort {
    using FileSort::FileSort;
    const OBS* GetRecord() override { ADD_FAILURE() << "callback ran"; return nullptr; }
    void PutRecord(const OBS*) override { ADD_FAILURE() << "callback ran"; }
  };
  for (const Key& bad : std::vector<Key>{{-1, 1, 0}, {4, 1, 0}, {3, 1, 9}, {0, 1, 33}}) {
    try {
      Never sort({{0, 1, 0}, bad}, 4, nullptr);
      ADD_FAILURE() << "accepted variable " << bad.variable << " width " << bad.width;
    } catch (const ErrorText& e) {
      EXPECT_NE(e.Text().find("sort key 2"), std::string::npos) << e.Text();
      EXPECT_NE(e.Text().find("outside the record"), std::string::npos) << e.Text();
    }
  }
  EXPECT_NO_THROW(Never({{3, 1, 8}, {2, -1, 16}}, 4, nullptr));
}

namespace {

// A sort entry of numeric keys followed by a tag.
std::vector<OBS> Entry(std::vector<OBS> keys, std::uint32_t tag) {
  keys.push_back(0);
  SetTag(&keys.back(), tag);
  return keys;
}

}  // namespace

TEST(KeyCompare, NumbersTagsAndDirections) {
  FileSort::KeyCompare up({{0, 1, 0}});
  FileSort::KeyCompare down({{0, -1, 0}});
  auto a = Entry({1.0}, 5), b = Entry({2.0}, 1);
  EXPECT_LT(up.Compare(a.data(), b.data()), 0);
  EXPECT_GT(down.Compare(a.data(), b.data()), 0);
  // Equal keys: the smaller tag first, in either direction.
  auto c = Entry({1.0}, 1);
  EXPECT_GT(up.Compare(a.data(), c.data()), 0);
  EXPECT_GT(down.Compare(a.data(), c.data()), 0);
  EXPECT_EQ(up.Compare(a.data(), a.data()), 0);
  // -0.0 equals +0.0 and a NaN equals anything: the tag decides.
  auto negZero = Entry({FromBits(0x8000000000000000ull)}, 9), posZero = Entry({0.0}, 3);
  EXPECT_GT(up.Compare(negZero.data(), posZero.data()), 0);
  auto nan = Entry({FromBits(0x7FF8000000000000ull)}, 2), big = Entry({1e300}, 4);
  EXPECT_LT(up.Compare(nan.data(), big.data()), 0);
  EXPECT_GT(up.Compare(big.data(), nan.data()), 0);
}

// Tags are positions in a store that may pass 2 GiB: they must order as
// unsigned numbers, not by their wrapped difference.
TEST(KeyCompare, TagsCompareAsUnsigned) {
  FileSort::KeyCompare none({});
  auto low = Entry({}, 1), high = Entry({}, 0x80000001u), top = Entry({}, 0xFFFFFFFFu);
  EXPECT_LT(none.Compare(low.data(), high.data()), 0);
  EXPECT_GT(none.Compare(high.data(), low.data()), 0);
  EXPECT_LT(none.Compare(low.data(), top.data()), 0);
  EXPECT_LT(none.Compare(high.data(), top.data()), 0);
}

TEST(KeyCompare, StringKeysStepOverTheirValues) {
  // A width-9 key spans two values; the numeric key after it reads the third.
  FileSort::KeyCompare cmp({{0, 1, 9}, {2, -1, 0}});
  std::vector<OBS> a(4, 0.0), b(4, 0.0);
  std::memcpy(a.data(), "ABCDEFGHI", 9);
  std::memcpy(b.data(), "ABCDEFGHI", 9);
  a[2] = 1.0;
  b[2] = 2.0;
  SetTag(&a[3], 0);
  SetTag(&b[3], 1);
  EXPECT_GT(cmp.Compare(a.data(), b.data()), 0);  // equal strings, 2.0 first descending
  // Bytes past the width do not count.
  std::memcpy(a.data(), "ABCDEFGHIX", 10);
  EXPECT_GT(cmp.Compare(a.data(), b.data()), 0);
  std::memcpy(a.data(), "ABCDEFGHA", 9);
  EXPECT_LT(cmp.Compare(a.data(), b.data()), 0);
}

TEST(KeyCompare, DescendingKeepsTheCollatorsMagnitude) {
  FileSort::KeyCompare up({{0, 1, 2}}), down({{0, -1, 2}});
  auto a = Entry({FromText("AH      ")}, 0), b = Entry({FromText("AA      ")}, 1);
  const int r = up.Compare(a.data(), b.data());
  EXPECT_GT(r, 0);
  EXPECT_EQ(down.Compare(a.data(), b.data()), -r);
  // A copy compares exactly as its original.
  FileSort::KeyCompare copy(down);
  EXPECT_EQ(copy.Compare(a.data(), b.data()), -r);
}
