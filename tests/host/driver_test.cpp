// ptask::Driver: the order of calls the sort relies on, carried exceptions,
// and clean-up on every path.
#include <algorithm>
#include <atomic>
#include <new>
#include <stdexcept>
#include <vector>

#include <gtest/gtest.h>

#include "isort/host/ptask.h"

namespace {

struct Foreign {};  // an exception type that derives from nothing

// Problem and parts that check the driver's ordering rules as they run.
// Shared counters that only GetWork/Finish/destructors touch are plain
// integers on purpose: the driver's exclusion must make them safe (and the
// thread sanitizer checks that it does).
struct Checked : ptask::ProblemBase {
  struct Part : ptask::ProblemPartBase {
    explicit Part(Checked& p) : problem(p) { problem.live.fetch_add(1); }
    ~Part() override {
      if (problem.inGetWork.load() != 0) problem.violations.fetch_add(1);
      if (finished != 1 && !problem.expectNoFinish) problem.violations.fetch_add(1);
      problem.live.fetch_sub(1);
      ++problem.destroyed;  // serialised with GetWork/Finish by the driver
    }
    bool GetWork() override {
      if (problem.inGetWork.fetch_add(1) != 0) problem.violations.fetch_add(1);
      // No GetWork() while holding work, after Finish(), or after this
      // part's DoWork() threw.
      if (holding || finished || threw) problem.violations.fetch_add(1);
      ++problem.getWorkCalls;
      if (problem.throwInGetWorkAt >= 0 && problem.getWorkCalls == problem.throwInGetWorkAt) {
        problem.inGetWork.fetch_sub(1);
        throw std::runtime_error("from GetWork");
      }
      bool taken = false;
      if (problem.next < problem.items) {
        item = problem.next++;
        holding = true;
        taken = true;
      }
      problem.inGetWork.fetch_sub(1);
      return taken;
    }
    void DoWork() override {
      if (!holding) problem.violations.fetch_add(1);
      holding = false;
      // A little work of its own, so DoWork calls overlap.
      volatile unsigned spin = 0;
      for (unsigned i = 0; i < 200; ++i) spin = spin + i;
      results.push_back(item);
      if (item == problem.throwForeignAt) {
        threw = true;
        throw Foreign();
      }
    }
    void Finish() override {
      if (problem.inGetWork.load() != 0 || holding) problem.violations.fetch_add(1);
      ++finished;
      for (long r : results) problem.done.push_back(r);  // serialised by the driver
      if (problem.throwInFinish) {
        problem.throwInFinish = false;
        throw std::logic_error("from Finish");
      }
    }
    Checked& problem;
    bool holding = false;
    bool threw = false;
    int finished = 0;
    long item = -1;
    std::vector<long> results;
  };

  ptask::ProblemPartBase* CreatePart() override {
    if (created == failCreateAt) throw std::bad_alloc();
    ++created;
    return new Part(*this);
  }

  long items = 0;
  long next = 0;
  long getWorkCalls = 0;
  long destroyed = 0;
  int created = 0;
  int failCreateAt = -1;
  long throwForeignAt = -1;
  long throwInGetWorkAt = -1;
  bool throwInFinish = false;
  bool expectNoFinish = false;
  std::vector<long> done;
  std::atomic<int> inGetWork{0};
  std::atomic<int> violations{0};
  std::atomic<int> live{0};
};

// A thread count below 1 runs one part.
TEST(Driver, ManyThreadsManyTinyItems) {
  for (int threads : {0, 1, 2, 8}) {
    Checked problem;
    problem.items = 20000;
    ptask::Driver(&problem, threads);
    EXPECT_EQ(0, problem.violations.load()) << threads;
    EXPECT_EQ(0, problem.live.load());
    EXPECT_EQ(std::max(threads, 1), problem.created);
    EXPECT_EQ(std::max(threads, 1), problem.destroyed);
    // Every item done exactly once; the parts' plain writes are visible here.
    std::vector<long> done = problem.done;
    std::sort(done.begin(), done.end());
    ASSERT_EQ(static_cast<std::size_t>(problem.items), done.size());
    for (long i = 0; i < problem.items; ++i) ASSERT_EQ(i, done[i]);
  }
}

// The throwing part's worker calls no GetWork() again, whatever the others do.
TEST(Driver, ForeignExceptionReachesCallerAfterPartsAreGone) {
  for (int threads : {1, 8}) {
    Checked problem;
    problem.items = 50000;
    problem.throwForeignAt = 3000;
    int liveAtCatch = -1;
    try {
      ptask::Driver(&problem, threads);
      ADD_FAILURE() << "no exception";
    } catch (const Foreign&) {
      liveAtCatch = problem.live.load();
    }
    EXPECT_EQ(0, liveAtCatch);
    EXPECT_EQ(threads, problem.destroyed);
    EXPECT_EQ(0, problem.violations.load());
  }
}

TEST(Driver, GetWorkAndFinishExceptionsAreCarried) {
  {
    Checked problem;
    problem.items = 1000;
    problem.throwInGetWorkAt = 100;
    EXPECT_THROW(ptask::Driver(&problem, 4), std::runtime_error);
    EXPECT_EQ(0, problem.live.load());
    EXPECT_EQ(0, problem.violations.load());
  }
  {
    // Finish() of every part still runs, and the first failure wins.
    Checked problem;
    problem.items = 100;
    problem.throwInFinish = true;
    EXPECT_THROW(ptask::Driver(&problem, 3), std::logic_error);
    EXPECT_EQ(0, problem.live.load());
    EXPECT_EQ(100u, problem.done.size());
  }
}

TEST(Driver, CreatePartFailureDeletesThePartsMade) {
  Checked problem;
  problem.items = 100;
  problem.failCreateAt = 3;
  problem.expectNoFinish = true;
  EXPECT_THROW(ptask::Driver(&problem, 8), std::bad_alloc);
  EXPECT_EQ(0, problem.live.load());
  EXPECT_EQ(3, problem.destroyed);
  EXPECT_EQ(0, problem.getWorkCalls);
}

}  // namespace
