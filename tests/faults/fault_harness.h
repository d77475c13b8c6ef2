// Pieces shared by the fault suites: a fixture that checks, after every
// test and after every fault point, that nothing of the sort outlives it
// (temporary files, counted memory, file descriptors, threads), a sort whose
// callbacks can fail at any call, record sets with a known order, and the
// choice of fault points to try.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "alloc_counter.h"
#include "isort/host/errhub.h"
#include "isort/sortfile.h"
#include "sort_harness.h"

namespace faults {

using testing_support::Key;

// What a sort may hold while it runs and must give back when it is gone.
struct Resources {
  std::int64_t liveBytes = 0;  // counted operator new bytes
  int openFiles = 0;           // entries of /proc/self/fd
  int threads = 0;             // entries of /proc/self/task
};

int CountOpenFiles();
int CountThreads();

// Fault points to try out of `total` (numbered from 1): all of them up to
// 2,000; beyond that the first 200, the last 200 and 200 spread between.
std::vector<std::uint64_t> FaultPoints(std::uint64_t total);

// Records of `nvars` values: value 0 a numeric key with many ties, value 1
// the record's input position (so a lost or doubled record shows), the
// others awkward bit patterns that must come back unchanged.
struct Records {
  unsigned nvars = 0;
  std::size_t count = 0;
  std::vector<OBS> values;
  std::vector<Key> keys;
  std::vector<OBS> expected;  // the oracle's order
};
Records MakeRecords(std::size_t count, unsigned nvars, std::uint64_t seed);

// What the callbacks of one sort saw. The output buffer is sized before the
// sort, so the callbacks themselves allocate nothing and every allocation
// counted during a sort is the sort's own.
struct CallLog {
  explicit CallLog(const Records& r) : output(r.count * r.nvars) {}

  std::vector<OBS> output;  // delivered records, back to back
  std::size_t gets = 0;     // GetRecord() calls, the final one (null) included
  std::size_t puts = 0;     // PutRecord() calls
  // Called with the 0-based number of each call before it does anything;
  // may throw (set `threw` first).
  std::function<void(std::size_t call)> beforeGet;
  std::function<void(std::size_t call)> beforePut;
  bool threw = false;             // a hook threw
  bool calledAfterThrow = false;  // a callback ran after that
  bool overflow = false;          // more records came out than went in

  // The first puts records of the output equal the first of `expected`.
  bool DeliveredPrefixOf(const std::vector<OBS>& expected, unsigned nvars) const;
};

// A FileSort over a record set that logs its callbacks in a CallLog.
class HookedSort : public FileSort {
 public:
  HookedSort(const Records& r, CallLog& log, Statistics* stats = nullptr);

  const OBS* GetRecord() override;
  void PutRecord(const OBS* record) override;
  FileSort::Data& data() { return FileSortAccess::DataOf(*this); }

 private:
  const Records& records_;
  CallLog& log_;
};

// Settings that make kilobytes of records spill into several runs and at
// least two merge passes: the memory target below its public floor and
// small stream buffers.
constexpr std::uint32_t kSpillTarget = 4096;
constexpr unsigned kSpillBuffer = 512;
void MakeItSpill(FileSort& sort);

// The fixture of every fault test. Before the test: a private temporary
// directory with a file of the test's own (SortTest), and a record of the
// process's resources. After every fault point (ExpectReleased) and after
// the test: the directory holds nothing of the sort's, counted memory, file
// descriptors and threads are back where they were; after the test, a fresh
// sort in the same process still matches the oracle.
class FaultTest : public testing_support::SortTest {
 protected:
  static void SetUpTestSuite();
  void SetUp() override;
  void TearDown() override;

  Resources Now() const;
  // Checks that everything `before` recorded is back; `what` and `point`
  // name the fault point in failure messages (built only on failure, so the
  // check itself allocates nothing). Returns false (after reporting) if not.
  bool ExpectReleased(const Resources& before, const char* what, std::uint64_t point);

  Resources atStart_;
};

// How one sort ended.
enum class Ending { Completed, BadAlloc, Error, GoToCaller, Foreign, Other };
const char* Name(Ending e);

// A type no part of the system knows.
struct ForeignFailure {
  int code;
};

// Runs sort.Sort() and says how it ended; the ErrorText's text, if any,
// goes to *text.
Ending RunSort(FileSort& sort, std::string* text = nullptr);

// Classifies the exception in flight (call from a catch block).
Ending CurrentEnding(std::string* text = nullptr);

// SORTFILE's key array for the record set's keys.
std::vector<FortranInt> SortFileKeys(const Records& r);
// Calls SORTFILE over the record set with C++ callbacks that log in `log`.
// Returns its code, or -1 when an exception left it (*ending says which).
FortranInt CallSortFile(const Records& r, const std::vector<FortranInt>& ukeys, CallLog& log,
                        Ending* ending);

// Whether a fault-free SORTFILE over the record set reads temporary files
// back, that is, spills and merges.
bool SortFileSpills(const Records& r);

// True when `output` holds every input record exactly once, bit for bit
// (records are told apart by their position in value 1), in any order.
bool IsPermutationOfInput(const Records& records, const std::vector<OBS>& output);

}  // namespace faults
