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

class AllocationFaults : public FaultTest {
 protected:
  // Runs `sortOnce` (one sort into a fresh CallLog under the armed plan,
  // returning SORTFILE's code: 0 completed, 11 out of memory, -1 anything
  // else) failing each allocation point alone and every allocation from it
  // on. The points are those of the most allocations of three fault-free
  // runs: with several workers the count varies a little, and a point names
  // the Nth allocation of whichever thread makes it.
  template <class SortOnce>
  void EveryAllocation(const char* suite, const Records& r, SortOnce sortOnce) {
    std::uint64_t total = 0;
    for (int i = 0; i < 3; ++i) {
      CallLog log(r);
      ArmAllocations(AllocationPlan{});
      const FortranInt code = sortOnce(log);
      total = std::max(total, AllocationsSeen());
      ASSERT_EQ(code, 0) << suite;
      ASSERT_TRUE(log.Complete()) << suite;
    }
    ASSERT_GT(total, 10u) << "allocations are not being counted";
    std::uint64_t tried = 0, completed = 0, badAlloc = 0;
    for (bool fromThenOn : {false, true}) {
      for (std::uint64_t point : FaultPoints(total)) {
        const Resources before = Now();
        {
          CallLog log(r);
          ArmAllocations(AllocationPlan{point, fromThenOn});
          const FortranInt code = sortOnce(log);
          const bool failed = AllocationFailed();
          ArmAllocations(AllocationPlan{});
          ++tried;
          if (code == 0 && log.Complete()) {
            ++completed;
          } else if (code == 11 && failed && !log.overflow && log.Prefix()) {
            ++badAlloc;
          } else {
            ADD_FAILURE() << suite << ", allocation " << point << (fromThenOn ? " on" : "")
                          << ": code " << code << " after delivering " << log.puts << " of "
                          << r.count << " records (allocation failed: " << failed << ")";
          }
        }
        if (!ExpectReleased(before, suite, point)) return;
      }
    }
    std::printf("%s: %llu allocations, %llu points tried: %llu completed, %llu std::bad_alloc\n",
                suite, static_cast<unsigned long long>(total),
                static_cast<unsigned long long>(tried), static_cast<unsigned long long>(completed),
                static_cast<unsigned long long>(badAlloc));
    EXPECT_GT(badAlloc, 0u);
  }

  // A FileSort on `workers` workers, its construction included; one worker
  // comes of a row count that fits the memory target.
  void EveryAllocationOfAFileSort(unsigned workers, const char* suite) {
    if (workers != 1) UseThreads(workers);
    const Records r = MakeRecords(1200, 4, 5 + workers);
    auto setup = [workers](HookedSort& sort) {
      MakeItSpill(sort);
      if (workers == 1) sort.SetNRows(1);
    };
    {
      CallLog log(r);
      FileSort::Statistics stats;
      ASSERT_EQ(SortWith(log, setup, nullptr, &stats), Ending::Completed);
      ASSERT_GE(stats.runs.size(), 4u);
      ASSERT_GE(stats.merges.size(), 2u) << "the sort should merge in at least two passes";
      ASSERT_EQ(stats.threads, workers);
    }
    EveryAllocation(suite, r, [&setup](CallLog& log) -> FortranInt {
      FileSort::Statistics stats;  // recorded under the faults too
      const Ending ending = SortWith(log, setup, nullptr, &stats);
      return ending == Ending::Completed ? 0 : ending == Ending::BadAlloc ? 11 : -1;
    });
  }
};

TEST_F(AllocationFaults, OneWorker) { EveryAllocationOfAFileSort(1, "one worker"); }

TEST_F(AllocationFaults, ThreeWorkers) { EveryAllocationOfAFileSort(3, "three workers"); }

// SORTFILE over a sort delivered from memory; its callbacks allocate nothing.
TEST_F(AllocationFaults, SortFileReturnsEleven) {
  const Records r = MakeRecords(300, 4, 9);
  const std::vector<FortranInt> ukeys = SortFileKeys(r);
  EveryAllocation("SORTFILE in memory", r, [&ukeys](CallLog& log) {
    Ending ending;
    const FortranInt code = CallSortFile(log, ukeys, &ending);
    return ending == Ending::Completed ? code : -1;
  });
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
  ::operator delete(b);
  ::operator delete[](a);
  const std::int64_t liveAfterFree = LiveBytes();
  void* first = ::operator new(8);
  void* second = ::operator new(8, std::nothrow);
  void* third = ::operator new(8, std::nothrow);  // only the second fails
  const bool failedFlag = AllocationFailed();
  ArmAllocations(AllocationPlan{1, true});
  bool arrayFailed = false;
  try {
    ::operator delete[](::operator new[](16));
  } catch (const std::bad_alloc&) {
    arrayFailed = true;
  }
  void* fourth = ::operator new(16, std::nothrow);  // every one from the first fails
  DisarmAllocations();
  void* wide = ::operator new(64, std::align_val_t(64));
  ::operator delete(first);
  ::operator delete(third);

  EXPECT_EQ(seenAfterOne, 1u);
  EXPECT_EQ(liveAfterOne, live + 40);
  EXPECT_EQ(liveAfterFree, live);
  EXPECT_EQ(second, nullptr);
  EXPECT_NE(third, nullptr);
  EXPECT_TRUE(failedFlag);
  EXPECT_TRUE(arrayFailed);
  EXPECT_EQ(fourth, nullptr);
  EXPECT_EQ(reinterpret_cast<std::uintptr_t>(wide) % 64, 0u);
  ::operator delete(wide, std::align_val_t(64));
}

}  // namespace
}  // namespace faults
