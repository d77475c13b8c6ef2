// A failing temporary file at every file operation of a spilling sort, as a
// full disk (ENOSPC), a device error (EIO) and a transfer that stops short:
// the sort throws ErrorText whose text names the operation, the file and
// the system's reason (SORTFILE returns 5 and reports that text), and
// nothing is left behind.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>

#include "fault_harness.h"
#include "host/faultplan.h"
#include "host/hostsettings.h"
#include "sortfile_testing.h"

namespace faults {
namespace {

using vexahost::FaultPlan;
using vexahost::FileOp;

enum class Mode { NoSpace, DeviceError, ShortTransfer };

const char* Name(Mode m) {
  return m == Mode::NoSpace ? "ENOSPC" : m == Mode::DeviceError ? "EIO" : "short transfer";
}

FaultPlan PlanFor(Mode mode, std::uint64_t nth) {
  FaultPlan plan;
  plan.kind = FileOp::Any;
  plan.nth = nth;
  plan.error = mode == Mode::NoSpace ? vexahost::kErrorNoSpace : vexahost::kErrorIo;
  plan.shortTransfer = mode == Mode::ShortTransfer;
  return plan;
}

bool StartsWith(const std::string& s, const std::string& prefix) {
  return s.compare(0, prefix.size(), prefix) == 0;
}

bool EndsWith(const std::string& s, const std::string& suffix) {
  return s.size() >= suffix.size() &&
         s.compare(s.size() - suffix.size(), suffix.size(), suffix) == 0;
}

// "<operation> of <dir>/<sort|merge>XXXXXX failed: <reason>", the reason
// being the system's text for the injected error, or what the stream says
// of a transfer that made no progress.
bool NamesOperationAndReason(const std::string& text, const std::string& dir, Mode mode) {
  std::string operation;
  for (const char* op : {"create", "write", "read"}) {
    if (StartsWith(text, std::string(op) + " of " + dir + "/")) operation = op;
  }
  if (operation.empty()) return false;
  const std::string file = text.substr(operation.size() + 4 + dir.size() + 1);
  if (!StartsWith(file, "sort") && !StartsWith(file, "merge")) return false;
  switch (mode) {
    case Mode::NoSpace:
      return EndsWith(text, std::string(" failed: ") + std::strerror(ENOSPC));
    case Mode::DeviceError:
      return EndsWith(text, std::string(" failed: ") + std::strerror(EIO));
    case Mode::ShortTransfer:
      return (operation == "write" && EndsWith(text, " failed: no bytes were written")) ||
             (operation == "read" && EndsWith(text, " failed: the file ended early"));
  }
  return false;
}

class FileFaults : public FaultTest {
 protected:
  // File operations of a fault-free sort, checking that it spills.
  std::uint64_t DryRun(const Records& r, unsigned workers) {
    CallLog log(r);
    FileSort::Statistics stats;
    HookedSort sort(r, log, &stats);
    MakeItSpill(sort);
    if (workers == 1) sort.SetNRows(1);
    vexahost::ScopedFaultPlan counting(FaultPlan{});
    EXPECT_EQ(RunSort(sort), Ending::Completed);
    EXPECT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
    EXPECT_EQ(log.puts, r.count);
    EXPECT_GE(stats.merges.size(), 2u);
    std::printf("file operations of the sort: %llu creates, %llu writes, %llu reads\n",
                static_cast<unsigned long long>(vexahost::FileOperationsSeen(FileOp::Create)),
                static_cast<unsigned long long>(vexahost::FileOperationsSeen(FileOp::Write)),
                static_cast<unsigned long long>(vexahost::FileOperationsSeen(FileOp::Read)));
    return vexahost::FileOperationsSeen(FileOp::Any);
  }

  void EveryOperation(unsigned workers, const std::vector<Mode>& modes, bool sample) {
    if (workers != 1) UseThreads(workers);
    const Records r = MakeRecords(1500, 4, 11 + workers);
    const std::uint64_t total = DryRun(r, workers);
    ASSERT_GT(total, 20u);
    std::vector<std::uint64_t> points = FaultPoints(total);
    if (sample) {
      std::vector<std::uint64_t> some;
      for (std::size_t i = 0; i < points.size(); i += points.size() / 40 + 1)
        some.push_back(points[i]);
      some.push_back(total);
      points = some;
    }
    for (Mode mode : modes) {
      std::uint64_t errors = 0, completed = 0, wrong = 0;
      for (std::uint64_t point : points) {
        const Resources before = Now();
        {
          CallLog log(r);
          HookedSort sort(r, log);
          MakeItSpill(sort);
          if (workers == 1) sort.SetNRows(1);
          std::string text;
          Ending ending;
          bool injected;
          {
            vexahost::ScopedFaultPlan armed(PlanFor(mode, point));
            ending = RunSort(sort, &text);
            injected = vexahost::FaultInjected();
          }
          const bool prefix = !log.overflow && log.DeliveredPrefixOf(r.expected, r.nvars);
          if (ending == Ending::Error && injected && prefix &&
              NamesOperationAndReason(text, tempDir_, mode)) {
            ++errors;
          } else if (ending == Ending::Completed && !injected && prefix && log.puts == r.count) {
            ++completed;  // several workers: this run made fewer operations
          } else {
            ++wrong;
            ADD_FAILURE() << Name(mode) << " at file operation " << point << " of " << total << ": "
                          << Name(ending) << " \"" << text << "\", fault injected " << injected
                          << ", " << log.puts << " records delivered";
          }
        }
        if (!ExpectReleased(before, Name(mode), point)) return;
      }
      std::printf(
          "%u worker(s), %s: %zu of %llu file operations tried: %llu ErrorText, "
          "%llu completed without the fault, %llu wrong\n",
          workers, Name(mode), points.size(), static_cast<unsigned long long>(total),
          static_cast<unsigned long long>(errors), static_cast<unsigned long long>(completed),
          static_cast<unsigned long long>(wrong));
      EXPECT_GT(errors, 0u);
    }
  }
};

TEST_F(FileFaults, OneWorkerEveryOperation) {
  EveryOperation(1, {Mode::NoSpace, Mode::DeviceError, Mode::ShortTransfer}, false);
}

TEST_F(FileFaults, ThreeWorkersSpreadOperations) {
  EveryOperation(3, {Mode::NoSpace, Mode::ShortTransfer}, true);
}

// Two faults at once: a failing file operation while allocations fail from
// some point on, so that the error paths themselves (building the message,
// keeping a write that failed in a destructor, carrying the failure to the
// caller) run out of memory. Any clean ending will do: the whole output, or
// ErrorText, or std::bad_alloc; never a crash, a leak or a partial success.
TEST_F(FileFaults, WhileAllocationsFail) {
  const Records r = MakeRecords(1500, 4, 15);
  const std::uint64_t operations = DryRun(r, 1);
  std::uint64_t allocations;
  {
    CallLog log(r);
    ArmAllocations(AllocationPlan{});
    HookedSort sort(r, log);
    MakeItSpill(sort);
    sort.SetNRows(1);
    sort.Sort();
    allocations = AllocationsSeen();
    ArmAllocations(AllocationPlan{});
  }
  std::uint64_t tried = 0, errors = 0, badAllocs = 0, completed = 0;
  for (int i = 0; i < 24; ++i) {
    const std::uint64_t operation = 1 + (operations - 1) * i / 23;
    for (int j = 0; j < 24; ++j) {
      const std::uint64_t allocation = 1 + (allocations - 1) * j / 23;
      const Resources before = Now();
      {
        CallLog log(r);
        Ending ending;
        {
          vexahost::ScopedFaultPlan armed(
              PlanFor(i % 2 ? Mode::NoSpace : Mode::ShortTransfer, operation));
          ArmAllocations(AllocationPlan{allocation, true});
          try {
            HookedSort sort(r, log);
            MakeItSpill(sort);
            sort.SetNRows(1);
            ending = RunSort(sort);
          } catch (...) {
            ending = CurrentEnding();
          }
          ArmAllocations(AllocationPlan{});
        }
        ++tried;
        const bool prefix = !log.overflow && log.DeliveredPrefixOf(r.expected, r.nvars);
        if (ending == Ending::Error && prefix) {
          ++errors;
        } else if (ending == Ending::BadAlloc && prefix) {
          ++badAllocs;
        } else if (ending == Ending::Completed && prefix && log.puts == r.count) {
          ++completed;
        } else {
          ADD_FAILURE() << "file operation " << operation << ", allocations from " << allocation
                        << ": " << Name(ending) << " after " << log.puts << " records";
        }
      }
      if (!ExpectReleased(before, "double fault", tried)) return;
    }
  }
  std::printf(
      "file fault and allocation failures together: %llu tried: %llu ErrorText, "
      "%llu std::bad_alloc, %llu completed\n",
      static_cast<unsigned long long>(tried), static_cast<unsigned long long>(errors),
      static_cast<unsigned long long>(badAllocs), static_cast<unsigned long long>(completed));
}

// Through SORTFILE: 5, with the text handed to the host's reporter. The
// memory target cannot be lowered from outside, so the sort spills through
// many workers, each with a small share of the 100 MiB.
TEST_F(FileFaults, SortFileReportsAndReturnsFive) {
  UseThreads(64);
  vexahost::SetStreamBufferSize(64 << 10);
  const Records r = MakeRecords(12000, 10, 13);
  const std::vector<FortranInt> ukeys = SortFileKeys(r);
  std::uint64_t total;
  {
    CallLog log(r);
    vexahost::ScopedFaultPlan counting(FaultPlan{});
    Ending ending;
    ASSERT_EQ(CallSortFile(r, ukeys, log, &ending), 0);
    ASSERT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
    total = vexahost::FileOperationsSeen(FileOp::Any);
    ASSERT_GT(vexahost::FileOperationsSeen(FileOp::Read), 0u) << "the sort did not spill";
  }
  std::uint64_t errors = 0, completed = 0;
  for (Mode mode : {Mode::NoSpace, Mode::DeviceError, Mode::ShortTransfer}) {
    for (int k = 0; k < 10; ++k) {
      // Spread over the operations of the run counted above; with many
      // workers a run may make a few operations fewer than that one.
      const std::uint64_t point = 1 + (total - 1) * k / 10;
      SCOPED_TRACE(std::string(Name(mode)) + " at file operation " + std::to_string(point) +
                   " of " + std::to_string(total));
      const Resources before = Now();
      {
        sortfile_testing::ReportCapture capture;
        CallLog log(r);
        Ending ending;
        FortranInt code;
        bool injected;
        {
          vexahost::ScopedFaultPlan armed(PlanFor(mode, point));
          code = CallSortFile(r, ukeys, log, &ending);
          injected = vexahost::FaultInjected();
        }
        const std::vector<std::string> reports = capture.Reports();
        EXPECT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars));
        if (injected) {
          ++errors;
          EXPECT_EQ(code, 5);
          ASSERT_EQ(reports.size(), 1u);
          EXPECT_TRUE(NamesOperationAndReason(reports.back(), tempDir_, mode)) << reports.back();
        } else {
          ++completed;
          EXPECT_EQ(code, 0);
          EXPECT_EQ(log.puts, r.count);
          EXPECT_TRUE(reports.empty());
        }
      }
      ExpectReleased(before, Name(mode), point);
    }
  }
  std::printf(
      "SORTFILE: 30 of %llu file operations tried: %llu returned 5, %llu completed "
      "without the fault\n",
      static_cast<unsigned long long>(total), static_cast<unsigned long long>(errors),
      static_cast<unsigned long long>(completed));
  EXPECT_GT(errors, 20u);
}

}  // namespace
}  // namespace faults
