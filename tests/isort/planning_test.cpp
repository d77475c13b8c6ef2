// Thread count, memory target and batch sizing.
#include <gtest/gtest.h>

#include <memory>

#include "sort_harness.h"

using namespace testing_support;

class Planning : public SortTest {};

TEST_F(Planning, ThreadTable) {
  struct Row {
    unsigned packages, cores, setting;
    std::int64_t nrows;
    unsigned nvars, target, expect;
  };
  const unsigned M = 104857600;
  const Row rows[] = {
      {4, 2, 16, -1, 10, M, 8}, {4, 2, 3, -1, 10, M, 3}, {4, 2, 1, -1, 10, M, 2},
      {1, 1, 8, -1, 10, M, 2},  {4, 2, 16, 0, 10, M, 1}, {4, 2, 16, 1000000, 10, M, 1},
      {4, 2, 16, 1200000, 10, M, 8}, {4, 2, 16, 1638399, 7, M, 1},
      {4, 2, 16, 1638400, 7, M, 8},  {4, 2, 16, 3000000, 10, 300000000, 1},
  };
  for (const Row& r : rows) {
    vexahost::SetProcessorCounts(r.packages, r.cores);
    vexahost::SetThreadSetting(r.setting);
    EXPECT_EQ(ChooseThreads(r.nrows, r.nvars, r.target), r.expect)
        << r.packages << "x" << r.cores << " setting " << r.setting << " nrows " << r.nrows;
  }
}

TEST_F(Planning, MemoryTargetFloor) {
  std::vector<OBS> none;
  VectorSort sort({}, 1, &none, 0);
  for (unsigned bytes : {0u, 1u, 50000000u, 104857599u}) {
    sort.SetMemoryTarget(bytes);
    EXPECT_EQ(sort.data().memoryTarget, 104857600u);
  }
  for (unsigned bytes : {104857600u, 300000000u, 0xFFFFFFFFu}) {
    sort.SetMemoryTarget(bytes);
    EXPECT_EQ(sort.data().memoryTarget, bytes);
  }
  EXPECT_EQ(sort.data().nrows, -1);
  sort.SetNRows(-5);
  EXPECT_EQ(sort.data().nrows, -5);
}

TEST_F(Planning, EachPartTakesItsShare) {
  UseThreads(3);
  std::vector<OBS> input(40, 1.0);
  FileSort::Statistics stats;
  VectorSort sort({{0, 1, 0}}, 4, &input, 10, &stats);
  sort.Sort();
  ASSERT_EQ(stats.runs.size(), 1u);
  EXPECT_EQ(stats.runs[0].memoryShare, 34952533u);
  EXPECT_EQ(stats.threads, 3u);
}

// The first batch plans for uncompressed records and a store a third their size.
TEST_F(Planning, FirstBatchSizing) {
  std::vector<OBS> input(12 * 200, 0.0);
  VectorSort sort({{0, 1, 0}, {1, 1, 0}}, 12, &input, 200);
  sort.ForceMemoryTarget(10000);
  sort.data().threads = 1;
  std::unique_ptr<ptask::ProblemPartBase> part(sort.data().CreatePart());
  auto* sorter = static_cast<FileSort::Sorter*>(part.get());
  ASSERT_TRUE(sorter->GetWork());
  EXPECT_EQ(sorter->runInfo.memoryShare, 10000u);
  EXPECT_EQ(sorter->runInfo.capacity, 96u);
  EXPECT_EQ(sorter->storeLimit, 2496u);
}

// A memory share smaller than one record still reads one record per batch:
// no input is left unread.
TEST_F(Planning, TinyShareStillSortsEverything) {
  std::mt19937_64 rng(5);
  const std::size_t n = 60;
  std::vector<OBS> input(n * 4);
  for (OBS& v : input) v = static_cast<double>(rng() % 10);
  std::vector<Key> keys{{2, -1, 0}};
  FileSort::Statistics stats;
  VectorSort sort(keys, 4, &input, n, &stats);
  sort.ForceMemoryTarget(16);
  sort.Sort();
  EXPECT_TRUE(SameBits(sort.output, OracleSort(input, n, 4, keys)));
  EXPECT_EQ(stats.records, n);
  for (const auto& run : stats.runs) EXPECT_EQ(run.capacity, 1u);
}
