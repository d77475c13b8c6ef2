// Callbacks that throw, at every call of small sorts and at ten calls spread
// over large ones, in the single-batch path and in the merge, with every
// kind of exception. FileSort: std::bad_alloc and ErrorText are recorded by
// the workers and raised again by Sort(); VexaGoToCaller and a foreign type
// leave Sort() unchanged. SORTFILE: 11, 5 (reported), 14, and a foreign type
// passes through. No callback runs after the throw and nothing leaks.
// (The first records of each kind at a few points are in the sort's own
// tests; these cover every call, GoToCaller, SORTFILE and the leak checks.)
#include <gtest/gtest.h>

#include <cstdio>

#include "fault_harness.h"
#include "host/hostsettings.h"
#include "sortfile_testing.h"

namespace faults {
namespace {

enum class Kind { BadAlloc, Error, GoToCaller, Foreign };
const Kind kKinds[] = {Kind::BadAlloc, Kind::Error, Kind::GoToCaller, Kind::Foreign};

const char* Name(Kind k) {
  switch (k) {
    case Kind::BadAlloc:
      return "std::bad_alloc";
    case Kind::Error:
      return "ErrorText";
    case Kind::GoToCaller:
      return "VexaGoToCaller";
    case Kind::Foreign:
      return "foreign";
  }
  return "?";
}

Ending Expected(Kind k) {
  switch (k) {
    case Kind::BadAlloc:
      return Ending::BadAlloc;
    case Kind::Error:
      return Ending::Error;
    case Kind::GoToCaller:
      return Ending::GoToCaller;
    case Kind::Foreign:
      return Ending::Foreign;
  }
  return Ending::Other;
}

// SORTFILE's code for each kind; -1: the exception leaves SORTFILE.
FortranInt ExpectedCode(Kind k) {
  switch (k) {
    case Kind::BadAlloc:
      return 11;
    case Kind::Error:
      return 5;
    case Kind::GoToCaller:
      return 14;
    case Kind::Foreign:
      return -1;
  }
  return 0;
}

const char kMessage[] = "the callback gave up";

[[noreturn]] void Throw(Kind k) {
  switch (k) {
    case Kind::BadAlloc:
      throw std::bad_alloc();
    case Kind::Error:
      throw ErrorText(kMessage, 3);
    case Kind::GoToCaller:
      throw VexaGoToCaller();
    case Kind::Foreign:
      throw ForeignFailure{42};
  }
  throw 0;
}

enum class Path { SingleBatch, Merge };
const char* Name(Path p) { return p == Path::SingleBatch ? "single batch" : "merge"; }

// The single batch: a target of 8 MiB holds every input here in the first
// batch, its store too (and spares the sanitizers the default target's
// 100 MiB buffers).
// The merge path: a target of a few hundred bytes gives batches of a few
// records and merge passes of two runs each, so even 40 records go through
// many runs and passes.
void ChoosePath(HookedSort& sort, Path path, std::size_t records) {
  if (path == Path::SingleBatch) {
    sort.data().memoryTarget = 8 << 20;
    return;
  }
  MakeItSpill(sort);
  if (records < 500) sort.data().memoryTarget = 600;
}

// The calls of `count` at which to throw: all, or ten spread over them.
std::vector<std::size_t> Calls(std::size_t count, bool all) {
  std::vector<std::size_t> calls;
  if (all) {
    for (std::size_t i = 0; i < count; ++i) calls.push_back(i);
  } else {
    for (std::size_t k = 0; k < 10; ++k) calls.push_back((count - 1) * k / 9);
  }
  return calls;
}

class CallbackFaults : public FaultTest {
 protected:
  void EveryCall(std::size_t records, unsigned workers, bool all) {
    if (workers != 1) UseThreads(workers);
    const Records r = MakeRecords(records, 4, 17 + records);
    std::uint64_t cases = 0;
    for (Path path : {Path::SingleBatch, Path::Merge}) {
      {
        CallLog log(r);
        FileSort::Statistics stats;
        HookedSort sort(r, log, &stats);
        ChoosePath(sort, path, records);
        if (workers == 1) sort.SetNRows(1);
        ASSERT_EQ(RunSort(sort), Ending::Completed);
        if (path == Path::SingleBatch) {
          ASSERT_TRUE(stats.merges.empty()) << "not a single batch";
        } else {
          ASSERT_GE(stats.merges.size(), 2u) << "fewer than two merge passes";
        }
      }
      for (bool inPut : {false, true}) {
        // GetRecord is called once more than there are records: the end.
        const std::size_t count = inPut ? records : records + 1;
        for (Kind kind : kKinds) {
          for (std::size_t call : Calls(count, all)) {
            ++cases;
            const Resources before = Now();
            {
              CallLog log(r);
              auto hook = [&log, kind, call](std::size_t k) {
                if (k == call) {
                  log.threw = true;
                  Throw(kind);
                }
              };
              (inPut ? log.beforePut : log.beforeGet) = hook;
              HookedSort sort(r, log);
              ChoosePath(sort, path, records);
              if (workers == 1) sort.SetNRows(1);
              std::string text;
              const Ending ending = RunSort(sort, &text);
              const bool ok = ending == Expected(kind) && !log.calledAfterThrow &&
                              (kind != Kind::Error || text == kMessage) &&
                              log.puts == (inPut ? call : 0) &&
                              log.DeliveredPrefixOf(r.expected, r.nvars);
              // The same failure again, with no callback.
              const std::size_t gets = log.gets, puts = log.puts;
              const bool again =
                  RunSort(sort) == Expected(kind) && log.gets == gets && log.puts == puts;
              if (!ok || !again) {
                ADD_FAILURE() << Name(path) << ", " << workers << " worker(s), " << Name(kind)
                              << " from " << (inPut ? "PutRecord" : "GetRecord") << " call " << call
                              << ": ended with " << Name(ending) << " \"" << text << "\", "
                              << log.puts << " delivered, callback after the throw "
                              << log.calledAfterThrow << ", second Sort() " << again;
              }
            }
            if (!ExpectReleased(before, "callback throw", call)) return;
          }
        }
      }
    }
    std::printf("%zu records, %u worker(s): %llu throwing calls tried\n", records, workers,
                static_cast<unsigned long long>(cases));
  }

  void SortFileCalls(std::size_t records, unsigned nvars, bool all) {
    const Records r = MakeRecords(records, nvars, 19 + records);
    const std::vector<FortranInt> ukeys = SortFileKeys(r);
    ASSERT_EQ(SortFileSpills(r), records > 1000) << "not the path meant";
    std::uint64_t cases = 0;
    for (bool inPut : {false, true}) {
      const std::size_t count = inPut ? records : records + 1;
      for (Kind kind : kKinds) {
        for (std::size_t call : Calls(count, all)) {
          ++cases;
          const Resources before = Now();
          {
            sortfile_testing::ReportCapture capture;
            CallLog log(r);
            auto hook = [&log, kind, call](std::size_t k) {
              if (k == call) {
                log.threw = true;
                Throw(kind);
              }
            };
            (inPut ? log.beforePut : log.beforeGet) = hook;
            Ending ending;
            const FortranInt code = CallSortFile(r, ukeys, log, &ending);
            const std::vector<std::string> reports = capture.Reports();
            const bool ok =
                code == ExpectedCode(kind) &&
                ending == (kind == Kind::Foreign ? Ending::Foreign : Ending::Completed) &&
                !log.calledAfterThrow && log.puts == (inPut ? call : 0) &&
                log.DeliveredPrefixOf(r.expected, r.nvars) &&
                reports.size() == (kind == Kind::Error ? 1u : 0u) &&
                (reports.empty() || reports[0] == kMessage);
            if (!ok) {
              ADD_FAILURE() << "SORTFILE, " << Name(kind) << " from "
                            << (inPut ? "the output" : "the input") << " function, call " << call
                            << ": code " << code << ", " << Name(ending) << ", " << log.puts
                            << " delivered, " << reports.size()
                            << " reports, callback after the throw " << log.calledAfterThrow;
            }
          }
          if (!ExpectReleased(before, "SORTFILE callback throw", call)) return;
        }
      }
    }
    std::printf("SORTFILE, %zu records: %llu throwing calls tried\n", records,
                static_cast<unsigned long long>(cases));
  }
};

TEST_F(CallbackFaults, EveryCallOfSmallSortsOneWorker) { EveryCall(40, 1, true); }

TEST_F(CallbackFaults, EveryCallOfSmallSortsThreeWorkers) { EveryCall(40, 3, true); }

TEST_F(CallbackFaults, SpreadCallsOfLargeSorts) {
  EveryCall(3000, 1, false);
  EveryCall(3000, 3, false);
}

// A sort that SORTFILE delivers from memory: every call. Sixteen workers
// keep each one's share of the 100 MiB target, which its batch buffer is
// sized for, small.
TEST_F(CallbackFaults, SortFileEveryCallOfASmallSort) {
  UseThreads(16);
  SortFileCalls(20, 4, true);
}

// A sort that SORTFILE spills and merges: many workers, each with a small
// share of the 100 MiB target, and wide records, so that a few batches
// take tens of thousands of them.
TEST_F(CallbackFaults, SortFileSpreadCallsOfASpilledSort) {
  UseThreads(64);
  SortFileCalls(12000, 10, false);
}

}  // namespace
}  // namespace faults
