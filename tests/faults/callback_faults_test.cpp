// Callbacks that throw, at every call of small sorts and at ten calls spread
// over large ones, in the single-batch path and in the merge, with every
// kind of exception. FileSort: std::bad_alloc and ErrorText are recorded by
// the workers and raised again by Sort(); VexaGoToCaller and a foreign type
// leave Sort() unchanged. SORTFILE: 11, 5 (reported), 14, and a foreign type
// passes through. No callback runs after the throw and nothing leaks.
#include <gtest/gtest.h>

#include <cstdio>

#include "fault_harness.h"
#include "host/hostsettings.h"
#include "sortfile_testing.h"

namespace faults {
namespace {

const Ending kKinds[] = {Ending::BadAlloc, Ending::Error, Ending::GoToCaller, Ending::Foreign};
const char kMessage[] = "the callback gave up";

[[noreturn]] void Throw(Ending kind) {
  switch (kind) {
    case Ending::BadAlloc:
      throw std::bad_alloc();
    case Ending::Error:
      throw ErrorText(kMessage, 3);
    case Ending::GoToCaller:
      throw VexaGoToCaller();
    default:
      throw ForeignFailure{42};
  }
}

// SORTFILE's code for each kind, by Ending; -1: the exception leaves SORTFILE.
const FortranInt kSortFileCode[] = {0, 11, 5, 14, -1};

class CallbackFaults : public FaultTest {
 protected:
  // For each callback, kind and call (every call, or ten spread over them),
  // a fresh CallLog whose hook throws there goes to `check`, which returns
  // what was wrong, if anything. GetRecord is called once more than there
  // are records: the end.
  template <class Check>
  void EveryThrow(const Records& r, bool all, const char* what, Check check) {
    std::uint64_t tried = 0;
    for (bool inPut : {false, true}) {
      const std::size_t count = inPut ? r.count : r.count + 1;
      for (Ending kind : kKinds) {
        for (std::size_t k = 0; k < (all ? count : 10); ++k) {
          const std::size_t call = all ? k : (count - 1) * k / 9;
          const Resources before = Now();
          {
            CallLog log(r);
            (inPut ? log.beforePut : log.beforeGet) = [&log, kind, call](std::size_t n) {
              if (n == call) {
                log.threw = true;
                Throw(kind);
              }
            };
            const std::string problem = check(log, kind, inPut ? call : 0);
            if (!problem.empty()) {
              ADD_FAILURE() << what << ": " << Name(kind) << " from "
                            << (inPut ? "PutRecord" : "GetRecord") << " call " << call << ": "
                            << problem << ", " << log.puts
                            << " delivered, callback after the throw " << log.calledAfterThrow;
            }
          }
          ++tried;
          if (!ExpectReleased(before, what, call)) return;
        }
      }
    }
    std::printf("%s, %zu records: %llu throwing calls tried\n", what, r.count,
                static_cast<unsigned long long>(tried));
  }

  // The single batch: a target of 8 MiB holds every input here in one batch
  // (and spares the sanitizers the default target's 100 MiB buffers). The
  // merge: a target of a few hundred bytes gives batches of a few records
  // and passes of two runs each, so even 40 records make many of both.
  void FileSortThrows(std::size_t records, unsigned workers, bool all) {
    if (workers != 1) UseThreads(workers);
    const Records r = MakeRecords(records, 4, 17 + records);
    for (bool merge : {false, true}) {
      auto setup = [merge, records, workers](HookedSort& sort) {
        sort.data().memoryTarget = 8 << 20;
        if (merge) MakeItSpill(sort);
        if (merge && records < 500) sort.data().memoryTarget = 600;
        if (workers == 1) sort.SetNRows(1);
      };
      {
        CallLog log(r);
        FileSort::Statistics stats;
        ASSERT_EQ(SortWith(log, setup, nullptr, &stats), Ending::Completed);
        ASSERT_EQ(stats.merges.empty(), !merge) << "not the path meant";
        ASSERT_TRUE(!merge || stats.merges.size() >= 2) << "fewer than two merge passes";
      }
      const std::string what = std::string(merge ? "merge, " : "single batch, ") +
                               std::to_string(workers) + " worker(s)";
      EveryThrow(r, all, what.c_str(), [&](CallLog& log, Ending kind, std::size_t puts) {
        HookedSort sort(log);
        setup(sort);
        std::string text;
        const Ending ending = RunSort(sort, &text);
        // The same failure again, with no callback.
        const std::size_t gets = log.gets, delivered = log.puts;
        const bool again = RunSort(sort) == kind && log.gets == gets && log.puts == delivered;
        const bool ok = ending == kind && !log.calledAfterThrow && log.puts == puts &&
                        log.Prefix() && (kind != Ending::Error || text == kMessage);
        return ok && again ? std::string()
                           : std::string("ended with ") + Name(ending) + " \"" + text +
                                 "\", second Sort() " + (again ? "right" : "wrong");
      });
    }
  }

  void SortFileThrows(std::size_t records, unsigned nvars, bool all) {
    const Records r = MakeRecords(records, nvars, 19 + records);
    const std::vector<FortranInt> ukeys = SortFileKeys(r);
    ASSERT_EQ(SortFileSpills(r), records > 1000) << "not the path meant";
    EveryThrow(r, all, "SORTFILE", [&ukeys](CallLog& log, Ending kind, std::size_t puts) {
      sortfile_testing::ReportCapture capture;
      Ending ending;
      const FortranInt code = CallSortFile(log, ukeys, &ending);
      const std::vector<std::string> reports = capture.Reports();
      const bool ok = code == kSortFileCode[static_cast<int>(kind)] &&
                      ending == (kind == Ending::Foreign ? kind : Ending::Completed) &&
                      !log.calledAfterThrow && log.puts == puts && log.Prefix() &&
                      reports.size() == (kind == Ending::Error ? 1u : 0u) &&
                      (reports.empty() || reports[0] == kMessage);
      return ok ? std::string()
                : "code " + std::to_string(code) + ", " + Name(ending) + ", " +
                      std::to_string(reports.size()) + " reports";
    });
  }
};

TEST_F(CallbackFaults, EveryCallOfSmallSorts) {
  FileSortThrows(40, 1, true);
  FileSortThrows(40, 3, true);
}

TEST_F(CallbackFaults, SpreadCallsOfLargeSorts) {
  FileSortThrows(3000, 1, false);
  FileSortThrows(3000, 3, false);
}

// SORTFILE cannot lower the memory target: sixteen workers keep each one's
// share of the 100 MiB, which its batch buffer is sized for, small, and a
// small sort is delivered from memory; sixty-four and wide records make a
// large one spill and merge.
TEST_F(CallbackFaults, SortFileInMemoryAndSpilled) {
  UseThreads(16);
  SortFileThrows(20, 4, true);
  UseThreads(64);
  SortFileThrows(12000, 10, false);
}

}  // namespace
}  // namespace faults
