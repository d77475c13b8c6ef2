// Allocation failure at every allocation of a sort that spills into several
// runs and merges them in at least two passes: the sort either completes
// with the oracle's output or throws std::bad_alloc (SORTFILE: returns 11);
// it never terminates, never returns normally with part of the output, and
// never leaks.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdio>

#include "fault_harness.h"
#include "host/hostsettings.h"

namespace faults {
namespace {

// How the points of one suite ended, printed for the record.
struct Tally {
  std::uint64_t points = 0;
  std::uint64_t completed = 0;        // the planned allocation never came
  std::uint64_t completedFailed = 0;  // it came and failed, and the sort still completed
  std::uint64_t badAlloc = 0;
  std::uint64_t wrong = 0;  // anything else: reported as a failure

  void Print(const char* suite, std::uint64_t allocations, std::int64_t peak) const {
    std::printf(
        "%s: %llu allocations (peak %lld counted bytes), %llu points tried: %llu completed, "
        "%llu completed after a failed allocation, %llu std::bad_alloc, %llu wrong\n",
        suite, static_cast<unsigned long long>(allocations), static_cast<long long>(peak),
        static_cast<unsigned long long>(points), static_cast<unsigned long long>(completed),
        static_cast<unsigned long long>(completedFailed), static_cast<unsigned long long>(badAlloc),
        static_cast<unsigned long long>(wrong));
  }
};

class AllocationFaults : public FaultTest {
 protected:
  // How one sort under a plan went.
  struct Run {
    Ending ending = Ending::Other;
    bool failed = false;     // the plan failed an allocation
    std::uint64_t seen = 0;  // allocations numbered
    std::int64_t peak = 0;   // highest counted bytes above those live before
  };

  // One sort of `r` under `plan`, the construction of the FileSort included;
  // `workers` 1 announces a row count that fits the memory target, which is
  // what gives a single worker.
  Run SortUnder(const Records& r, CallLog& log, FileSort::Statistics* stats, unsigned workers,
                const AllocationPlan& plan) {
    Run run;
    const std::int64_t before = LiveBytes();
    ArmAllocations(plan);
    try {
      HookedSort sort(r, log, stats);
      MakeItSpill(sort);
      if (workers == 1) sort.SetNRows(1);
      run.ending = RunSort(sort);
    } catch (...) {
      run.ending = CurrentEnding();
    }
    run.failed = AllocationFailed();
    run.seen = AllocationsSeen();
    run.peak = PeakBytes() - before;
    ArmAllocations(AllocationPlan{});  // back to counting only
    return run;
  }

  // Allocations of a fault-free sort (the most of three runs, as with
  // several workers the count varies a little), checking that it spills
  // and merges in at least two passes.
  std::uint64_t DryRun(const Records& r, unsigned workers, std::int64_t* peak) {
    std::uint64_t most = 0;
    for (int i = 0; i < 3; ++i) {
      CallLog log(r);
      FileSort::Statistics stats;
      const Run run = SortUnder(r, log, &stats, workers, AllocationPlan{});
      EXPECT_EQ(run.ending, Ending::Completed);
      most = std::max(most, run.seen);
      *peak = run.peak;
      EXPECT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
      EXPECT_EQ(log.puts, r.count);
      EXPECT_GE(stats.runs.size(), 4u);
      EXPECT_GE(stats.merges.size(), 2u) << "the sort should merge in at least two passes";
      EXPECT_EQ(stats.threads, workers);
    }
    return most;
  }

  void EveryAllocation(unsigned workers, bool fromThenOn, const char* suite) {
    if (workers != 1) UseThreads(workers);
    const Records r = MakeRecords(1200, 4, 5 + workers);
    std::int64_t peak = 0;
    const std::uint64_t total = DryRun(r, workers, &peak);
    ASSERT_GT(total, 50u) << "allocations are not being counted";
    Tally tally;
    for (std::uint64_t point : FaultPoints(total)) {
      const Resources before = Now();
      {
        CallLog log(r);
        FileSort::Statistics stats;
        const Run run = SortUnder(r, log, &stats, workers, AllocationPlan{point, fromThenOn});
        const Ending ending = run.ending;
        const bool failed = run.failed;
        ++tally.points;
        if (ending == Ending::Completed && log.puts == r.count && !log.overflow &&
            log.DeliveredPrefixOf(r.expected, r.nvars)) {
          ++(failed ? tally.completedFailed : tally.completed);
        } else if (ending == Ending::BadAlloc && failed && !log.overflow &&
                   log.DeliveredPrefixOf(r.expected, r.nvars)) {
          ++tally.badAlloc;
        } else {
          ++tally.wrong;
          ADD_FAILURE() << suite << ", allocation " << point << ": ended with " << Name(ending)
                        << " after delivering " << log.puts << " of " << r.count
                        << " records (allocation failed: " << failed << ")";
        }
      }
      if (!ExpectReleased(before, suite, point)) break;
    }
    tally.Print(suite, total, peak);
    EXPECT_GT(tally.badAlloc, 0u);
  }
};

TEST_F(AllocationFaults, OneWorkerEachAllocationOnce) {
  EveryAllocation(1, false, "one worker, one allocation fails");
}

TEST_F(AllocationFaults, OneWorkerEveryAllocationFromNOn) {
  EveryAllocation(1, true, "one worker, every allocation from N on fails");
}

// With several workers the order of allocations varies from run to run: a
// point names the Nth allocation of whichever thread makes it, and either
// ending is accepted as long as it is a clean one.
TEST_F(AllocationFaults, ThreeWorkersEachAllocationOnce) {
  EveryAllocation(3, false, "three workers, one allocation fails");
}

TEST_F(AllocationFaults, ThreeWorkersEveryAllocationFromNOn) {
  EveryAllocation(3, true, "three workers, every allocation from N on fails");
}

// SORTFILE over a sort delivered from memory: 0 with the whole output, or
// 11; a failure inside the callbacks' own code is not involved (they
// allocate nothing).
TEST_F(AllocationFaults, SortFileReturnsElevenAtEveryAllocation) {
  const Records r = MakeRecords(300, 4, 9);
  const std::vector<FortranInt> ukeys = SortFileKeys(r);
  std::uint64_t total = 0;
  for (int i = 0; i < 3; ++i) {
    CallLog log(r);
    ArmAllocations(AllocationPlan{});
    Ending ending;
    const FortranInt code = CallSortFile(r, ukeys, log, &ending);
    total = std::max(total, AllocationsSeen());
    EXPECT_EQ(code, 0);
    ASSERT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
  }
  ArmAllocations(AllocationPlan{});
  ASSERT_GT(total, 10u);
  Tally tally;
  for (bool fromThenOn : {false, true}) {
    for (std::uint64_t point : FaultPoints(total)) {
      const Resources before = Now();
      {
        CallLog log(r);
        Ending ending;
        ArmAllocations(AllocationPlan{point, fromThenOn});
        const FortranInt code = CallSortFile(r, ukeys, log, &ending);
        const bool failed = AllocationFailed();
        ArmAllocations(AllocationPlan{});
        ++tally.points;
        if (ending == Ending::Completed && code == 0 && log.puts == r.count &&
            log.DeliveredPrefixOf(r.expected, r.nvars)) {
          ++(failed ? tally.completedFailed : tally.completed);
        } else if (ending == Ending::Completed && code == 11 && failed &&
                   log.DeliveredPrefixOf(r.expected, r.nvars)) {
          ++tally.badAlloc;
        } else {
          ++tally.wrong;
          ADD_FAILURE() << "SORTFILE, allocation " << point << (fromThenOn ? " on" : "") << ": "
                        << Name(ending) << ", code " << code << ", " << log.puts
                        << " records delivered";
        }
      }
      if (!ExpectReleased(before, "SORTFILE", point)) break;
    }
  }
  tally.Print("SORTFILE, in memory, one allocation and every one from N on", total, 0);
  EXPECT_GT(tally.badAlloc, 0u);
}

// The counter itself: off until armed, exact about what it counted, and
// failing just the planned allocations. Figures are taken first and checked
// after, as the checks may allocate.
TEST(AllocationCounter, CountsFailsAndPassesThrough) {
  ArmAllocations(AllocationPlan{});
  const std::int64_t live = LiveBytes();
  void* a = ::operator new[](40);
  const std::uint64_t seenAfterOne = AllocationsSeen();
  const std::int64_t liveAfterOne = LiveBytes();
  DisarmAllocations();
  void* b = ::operator new(4);  // not counted, and freed armed below without harm
  ArmAllocations(AllocationPlan{2, false});
  const std::int64_t peakAtArm = PeakBytes();
  ::operator delete(b);
  ::operator delete[](a);
  const std::int64_t liveAfterFree = LiveBytes();
  void* first = ::operator new(8);
  bool secondFailed = false;
  try {
    ::operator delete(::operator new(8));
  } catch (const std::bad_alloc&) {
    secondFailed = true;
  }
  void* third = ::operator new(8, std::nothrow);  // only the second failed
  const bool failedFlag = AllocationFailed();
  ::operator delete(first);
  ::operator delete(third);
  ArmAllocations(AllocationPlan{2, true});
  void* ok = ::operator new(16);
  void* nothrowFailed = ::operator new(16, std::nothrow);
  bool arrayFailed = false;
  try {
    ::operator delete[](::operator new[](16));
  } catch (const std::bad_alloc&) {
    arrayFailed = true;
  }
  ::operator delete(ok);
  DisarmAllocations();
  void* wide = ::operator new(64, std::align_val_t(64));

  EXPECT_EQ(seenAfterOne, 1u);
  EXPECT_EQ(liveAfterOne, live + 40);
  EXPECT_EQ(peakAtArm, live + 40);
  EXPECT_EQ(liveAfterFree, live);
  EXPECT_TRUE(secondFailed);
  EXPECT_NE(third, nullptr);
  EXPECT_TRUE(failedFlag);
  EXPECT_EQ(nothrowFailed, nullptr);
  EXPECT_TRUE(arrayFailed);
  EXPECT_EQ(reinterpret_cast<std::uintptr_t>(wide) % 64, 0u);
  ::operator delete(wide, std::align_val_t(64));
}

}  // namespace
}  // namespace faults
