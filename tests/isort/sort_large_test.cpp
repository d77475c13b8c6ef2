// A sort of more than 100 MiB at the default memory target: runs written by
// two workers, merged. Slow tier.
#include <gtest/gtest.h>

#include <random>

#include "sort_harness.h"

using namespace testing_support;

class LargeSort : public SortTest {};

TEST_F(LargeSort, MoreThanTheMemoryTargetWithTwoThreads) {
  UseThreads(2);
  const unsigned nvars = 10;
  const std::size_t n = 1500000;  // 120 MB of records
  std::mt19937_64 rng(2024);
  std::vector<OBS> values(n * nvars);
  for (std::size_t r = 0; r < n; ++r) {
    OBS* rec = &values[r * nvars];
    std::memcpy(rec + 1, "KEY", 3);
    for (int i = 0; i < 12; ++i) reinterpret_cast<char*>(rec + 1)[i] = 'A' + rng() % 4;
    rec[0] = static_cast<double>(rng() % 1000);
    for (unsigned v = 3; v < nvars; ++v) rec[v] = AwkwardValue(rng);
  }
  std::vector<Key> keys{{1, 1, 12}, {0, -1, 0}};
  FileSort::Statistics stats;
  VectorSort sort(keys, nvars, &values, n, &stats);
  sort.Sort();
  ASSERT_TRUE(SameBits(sort.output, OracleSort(values, n, nvars, keys)));
  EXPECT_GE(stats.runs.size(), 2u);
  EXPECT_EQ(stats.merges.size(), 1u);
  EXPECT_EQ(stats.merges[0].runs, stats.runs.size());
  EXPECT_GT(stats.workFileBytes, 0u);
}

// The whole input in the first batch is delivered from memory; one record
// more makes two runs and a merge. With R = 0 a batch holds exactly
// share / ((K + 1) * 8) records.
TEST_F(LargeSort, SingleBatchBoundaryAtTheDefaultTarget) {
  UseThreads(2);
  const std::size_t capacity = (104857600 / 2) / 24;
  std::mt19937_64 rng(17);
  std::vector<OBS> values((capacity + 1) * 2);
  for (std::size_t i = 0; i < values.size(); ++i) values[i] = static_cast<double>(rng() % 1000);
  std::vector<Key> keys{{1, -1, 0}, {0, 1, 0}};
  for (std::size_t n : {capacity - 1, capacity, capacity + 1}) {
    FileSort::Statistics stats;
    VectorSort sort(keys, 2, &values, n, &stats);
    sort.Sort();
    ASSERT_TRUE(SameBits(sort.output, OracleSort(values, n, 2, keys))) << n;
    EXPECT_EQ(stats.runs.size(), n > capacity ? 2u : 1u);
    EXPECT_EQ(stats.runs[0].capacity, capacity);
    // At exactly the capacity the input ends on the batch boundary: run 0
    // is written and merged all the same.
    EXPECT_EQ(stats.merges.size(), n >= capacity ? 1u : 0u) << n;
    EXPECT_EQ(stats.workFileBytes == 0, n < capacity) << n;
  }
}

