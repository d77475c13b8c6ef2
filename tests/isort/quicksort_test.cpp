// The in-memory sort of a batch of entries.
#include <gtest/gtest.h>

#include <algorithm>
#include <random>

#include "QuickSort.h"
#include "sort_harness.h"

using namespace testing_support;

namespace {

// Entries of one numeric key and a tag; the tag is the entry's input index.
std::vector<OBS> MakeEntries(const std::vector<double>& keys) {
  std::vector<OBS> e(keys.size() * 2);
  for (std::size_t i = 0; i < keys.size(); ++i) {
    e[2 * i] = keys[i];
    SetTag(&e[2 * i + 1], static_cast<std::uint32_t>(i));
  }
  return e;
}

// Keys sorted stably: what the quicksort must give, as the tags make every
// entry distinct.
std::vector<std::uint32_t> StableOrder(const std::vector<double>& keys, bool descending) {
  std::vector<std::uint32_t> idx(keys.size());
  for (std::uint32_t i = 0; i < idx.size(); ++i) idx[i] = i;
  std::stable_sort(idx.begin(), idx.end(), [&](std::uint32_t a, std::uint32_t b) {
    return descending ? keys[a] > keys[b] : keys[a] < keys[b];
  });
  return idx;
}

std::vector<std::uint32_t> Tags(const std::vector<OBS>& e) {
  std::vector<std::uint32_t> t;
  for (std::size_t i = 1; i < e.size(); i += 2) t.push_back(TagLowWord(&e[i]));
  return t;
}

}  // namespace

TEST(QuickSortEntries, MatchesStableOrderAtEverySmallSizeAndBeyond) {
  std::mt19937_64 rng(11);
  std::vector<std::size_t> sizes;
  for (std::size_t n = 0; n <= 50; ++n) sizes.push_back(n);
  for (std::size_t n : {100, 1000, 4096, 20000}) sizes.push_back(n);
  for (std::size_t n : sizes) {
    for (int shape = 0; shape < 5; ++shape) {
      std::vector<double> keys(n);
      for (std::size_t i = 0; i < n; ++i) {
        switch (shape) {
          case 0: keys[i] = static_cast<double>(rng() % 7); break;  // many ties
          case 1: keys[i] = static_cast<double>(i); break;          // ascending
          case 2: keys[i] = static_cast<double>(n - i); break;      // descending
          case 3: keys[i] = 5.0; break;                             // all equal
          default: keys[i] = static_cast<double>(rng() % 1000000);
        }
      }
      for (int direction : {1, -1}) {
        FileSort::KeyCompare cmp({{0, direction, 0}});
        std::vector<OBS> e = MakeEntries(keys);
        QuickSortEntries(e.data(), static_cast<unsigned>(n), 2, cmp);
        ASSERT_EQ(Tags(e), StableOrder(keys, direction < 0))
            << "n=" << n << " shape=" << shape << " direction=" << direction;
      }
    }
  }
}

TEST(QuickSortEntries, TagOnlyEntries) {
  // Width 1: no keys, the order is the tags' order.
  std::mt19937_64 rng(3);
  std::vector<std::uint32_t> tags(500);
  for (std::uint32_t i = 0; i < tags.size(); ++i) tags[i] = i * 7919u % 500u;
  std::vector<OBS> e(tags.size());
  for (std::size_t i = 0; i < tags.size(); ++i) SetTag(&e[i], tags[i]);
  FileSort::KeyCompare cmp({});
  QuickSortEntries(e.data(), static_cast<unsigned>(e.size()), 1, cmp);
  for (std::size_t i = 0; i < e.size(); ++i) ASSERT_EQ(TagLowWord(&e[i]), i);
}

TEST(QuickSortEntries, MedianOfThreeAndSwap) {
  FileSort::KeyCompare cmp({{0, 1, 0}});
  auto a = MakeEntries({1.0}), b = MakeEntries({2.0}), c = MakeEntries({3.0});
  for (auto order : std::vector<std::vector<OBS*>>{{a.data(), b.data(), c.data()},
                                                   {c.data(), a.data(), b.data()},
                                                   {b.data(), c.data(), a.data()},
                                                   {c.data(), b.data(), a.data()}}) {
    EXPECT_EQ(MedianOfThree(order[0], order[1], order[2], cmp), b.data());
  }
  OBS x[3] = {FromBits(0x7FF0000000000001ull), 1, 2}, y[3] = {3, 4, FromText("ABCDEFGH")};
  SwapEntries(x, y, 3);
  EXPECT_EQ(Bits(y[0]), 0x7FF0000000000001ull);  // a signaling NaN moves as it is
  EXPECT_EQ(Bits(x[2]), Bits(FromText("ABCDEFGH")));
}

// An adversary that decides the keys while the sort runs (after McIlroy's
// "killer adversary"), pushing every pivot towards the top of its range so
// that the part before the pivot is nearly the whole range each time. A sort
// that always recurses into the part before the pivot then recurses once per
// entry; ours recurses into the smaller part, so its stack stays small.
TEST(QuickSortEntries, AdversarialInputKeepsTheStackShallow) {
  const std::size_t n = 20000;
  const long gas = -1;  // below every frozen value
  std::vector<long> value(n, gas);
  long nextSolid = static_cast<long>(n);
  long candidate = -1;
  auto id = [](const OBS* entry) { return static_cast<long>(TagLowWord(entry + 1)); };
  auto adversary = [&](const OBS* a, const OBS* b) {
    const long x = id(a), y = id(b);
    if (value[x] == gas && value[y] == gas) value[x == candidate ? x : y] = --nextSolid;
    if (value[x] == gas) {
      candidate = x;
    } else if (value[y] == gas) {
      candidate = y;
    }
    if (value[x] != value[y]) return value[x] < value[y] ? -1 : 1;
    return x < y ? -1 : x > y ? 1 : 0;
  };
  std::vector<OBS> probe = MakeEntries(std::vector<double>(n, 0.0));
  quicksort::Sort(probe.data(), n, 2, adversary);

  // Replay: the frozen values are a fixed input on which the real
  // comparison makes the very same decisions.
  std::vector<double> keys(n);
  for (std::size_t i = 0; i < n; ++i) keys[i] = static_cast<double>(value[i]);
  FileSort::KeyCompare cmp({{0, 1, 0}});
  const char* top = static_cast<const char*>(__builtin_frame_address(0));
  const char* lowest = top;
  auto measured = [&](const OBS* a, const OBS* b) {
    const char* here = static_cast<const char*>(__builtin_frame_address(0));
    if (here < lowest) lowest = here;
    return cmp.Compare(a, b);
  };
  std::vector<OBS> e = MakeEntries(keys);
  quicksort::Sort(e.data(), n, 2, measured);
  EXPECT_EQ(Tags(e), StableOrder(keys, false));
  EXPECT_LT(top - lowest, 32 * 1024) << "stack used: " << (top - lowest) << " bytes";
}
