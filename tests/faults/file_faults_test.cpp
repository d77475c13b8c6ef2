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
const std::vector<Mode> kModes = {Mode::NoSpace, Mode::DeviceError, Mode::ShortTransfer};

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

// "<operation> of <dir>/<sort|merge>XXXXXX failed: <reason>", the reason
// being the system's text for the injected error, or what the stream says
// of a transfer that made no progress.
bool NamesOperationAndReason(const std::string& text, const std::string& dir, Mode mode) {
  auto endsWith = [&text](const std::string& end) {
    return text.size() >= end.size() &&
           text.compare(text.size() - end.size(), end.size(), end) == 0;
  };
  for (const std::string op : {"create", "write", "read"}) {
    const std::string file = op + " of " + dir + "/";
    if (text.compare(0, file.size(), file) != 0) continue;
    if (text.compare(file.size(), 4, "sort") != 0 && text.compare(file.size(), 5, "merge") != 0) {
      return false;
    }
    switch (mode) {
      case Mode::NoSpace:
        return endsWith(std::string(" failed: ") + std::strerror(ENOSPC));
      case Mode::DeviceError:
        return endsWith(std::string(" failed: ") + std::strerror(EIO));
      case Mode::ShortTransfer:
        return (op == "write" && endsWith(" failed: no bytes were written")) ||
               (op == "read" && endsWith(" failed: the file ended early"));
    }
  }
  return false;
}

void OneSpillingWorker(HookedSort& sort) {
  MakeItSpill(sort);
  sort.SetNRows(1);
}

class FileFaults : public FaultTest {
 protected:
  // Runs `sortOnce` (one sort into a fresh CallLog, returning SORTFILE's
  // code: 0 completed, 5 failed with the error's text in *text, -1 anything
  // else) with each mode at each point. Where the fault came, the sort must
  // fail naming it, having delivered a prefix of the oracle's order; where
  // it did not (several workers make a few operations fewer from run to
  // run), complete. Most points must see their fault.
  template <class SortOnce>
  void EveryOperation(const char* what, const Records& r, const std::vector<Mode>& modes,
                      const std::vector<std::uint64_t>& points, SortOnce sortOnce) {
    for (Mode mode : modes) {
      std::uint64_t errors = 0;
      for (std::uint64_t point : points) {
        const Resources before = Now();
        {
          CallLog log(r);
          std::string text;
          FortranInt code;
          bool injected;
          {
            vexahost::ScopedFaultPlan armed(PlanFor(mode, point));
            code = sortOnce(log, &text);
            injected = vexahost::FaultInjected();
          }
          if (code == 5 && injected && !log.overflow && log.Prefix() &&
              NamesOperationAndReason(text, tempDir_, mode)) {
            ++errors;
          } else if (code != 0 || injected || !log.Complete()) {
            ADD_FAILURE() << what << ", " << Name(mode) << " at file operation " << point
                          << ": code " << code << " \"" << text << "\", fault injected " << injected
                          << ", " << log.puts << " records delivered";
          }
        }
        if (!ExpectReleased(before, Name(mode), point)) return;
      }
      std::printf("%s, %s: %zu file operations tried, %llu failed\n", what, Name(mode),
                  points.size(), static_cast<unsigned long long>(errors));
      EXPECT_GT(errors * 2, points.size()) << what << ", " << Name(mode);
    }
  }

  // A spilling FileSort: every fault point with one worker, some forty of
  // them with three.
  void FileSortOperations(unsigned workers, const std::vector<Mode>& modes) {
    auto setup = [workers](HookedSort& sort) {
      MakeItSpill(sort);
      if (workers == 1) sort.SetNRows(1);
    };
    if (workers != 1) UseThreads(workers);
    const Records r = MakeRecords(1500, 4, 11 + workers);
    std::uint64_t total;
    {
      CallLog log(r);
      FileSort::Statistics stats;
      vexahost::ScopedFaultPlan counting(FaultPlan{});
      ASSERT_EQ(SortWith(log, setup, nullptr, &stats), Ending::Completed);
      ASSERT_GE(stats.merges.size(), 2u);
      total = vexahost::FileOperationsSeen(FileOp::Any);
    }
    std::vector<std::uint64_t> points = FaultPoints(total), some;
    for (std::size_t i = 0; i < points.size(); i += points.size() / 40 + 1)
      some.push_back(points[i]);
    some.push_back(total);
    EveryOperation(workers == 1 ? "one worker" : "three workers", r, modes,
                   workers == 1 ? points : some, [&setup](CallLog& log, std::string* text) {
                     const Ending ending = SortWith(log, setup, text);
                     return ending == Ending::Completed ? 0 : ending == Ending::Error ? 5 : -1;
                   });
  }
};

TEST_F(FileFaults, OneWorkerEveryOperation) { FileSortOperations(1, kModes); }

TEST_F(FileFaults, ThreeWorkersSpreadOperations) {
  FileSortOperations(3, {Mode::NoSpace, Mode::ShortTransfer});
}

// Two faults at once: a failing file operation while allocations fail from
// some point on, so that the error paths themselves (building the message,
// keeping a write that failed in a destructor, carrying the failure to the
// caller) run out of memory. Any clean ending will do: the whole output, or
// ErrorText, or std::bad_alloc; never a crash, a leak or a partial success.
TEST_F(FileFaults, WhileAllocationsFail) {
  const Records r = MakeRecords(1500, 4, 15);
  std::uint64_t operations, allocations;
  {
    CallLog log(r);
    vexahost::ScopedFaultPlan counting(FaultPlan{});
    ArmAllocations(AllocationPlan{});
    ASSERT_EQ(SortWith(log, OneSpillingWorker), Ending::Completed);
    allocations = AllocationsSeen();
    operations = vexahost::FileOperationsSeen(FileOp::Any);
    ArmAllocations(AllocationPlan{});
  }
  std::uint64_t tried = 0, errors = 0, badAllocs = 0;
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
          ending = SortWith(log, OneSpillingWorker);
          ArmAllocations(AllocationPlan{});
        }
        ++tried;
        errors += ending == Ending::Error;
        badAllocs += ending == Ending::BadAlloc;
        const bool clean = ending == Ending::Completed
                               ? log.Complete()
                               : (ending == Ending::Error || ending == Ending::BadAlloc) &&
                                     !log.overflow && log.Prefix();
        if (!clean) {
          ADD_FAILURE() << "file operation " << operation << ", allocations from " << allocation
                        << ": " << Name(ending) << " after " << log.puts << " records";
        }
      }
      if (!ExpectReleased(before, "double fault", tried)) return;
    }
  }
  std::printf(
      "file fault and allocation failures together: %llu tried: %llu ErrorText, "
      "%llu std::bad_alloc\n",
      static_cast<unsigned long long>(tried), static_cast<unsigned long long>(errors),
      static_cast<unsigned long long>(badAllocs));
}

// Through SORTFILE: 5, with the text handed to the host's reporter. The
// memory target cannot be lowered from outside, so the sort spills through
// many workers, each with a small share of the 100 MiB.
TEST_F(FileFaults, SortFileReportsAndReturnsFive) {
  UseThreads(64);
  vexahost::SetStreamBufferSize(64 << 10);
  const Records r = MakeRecords(12000, 10, 13);
  const std::vector<FortranInt> ukeys = SortFileKeys(r);
  std::vector<std::uint64_t> points;
  {
    CallLog log(r);
    Ending ending;
    vexahost::ScopedFaultPlan counting(FaultPlan{});
    ASSERT_EQ(CallSortFile(log, ukeys, &ending), 0);
    ASSERT_GT(vexahost::FileOperationsSeen(FileOp::Read), 0u) << "the sort did not spill";
    const std::uint64_t total = vexahost::FileOperationsSeen(FileOp::Any);
    for (int k = 0; k < 10; ++k) points.push_back(1 + (total - 1) * k / 10);
  }
  EveryOperation("SORTFILE", r, kModes, points,
                 [&ukeys](CallLog& log, std::string* text) -> FortranInt {
                   sortfile_testing::ReportCapture capture;
                   Ending ending;
                   const FortranInt code = CallSortFile(log, ukeys, &ending);
                   const std::vector<std::string> reports = capture.Reports();
                   if (!reports.empty()) *text = reports[0];
                   return reports.size() == (code == 5 ? 1u : 0u) ? code : -1;
                 });
}

}  // namespace
}  // namespace faults
