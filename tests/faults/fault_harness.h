// Pieces shared by the fault suites: a fixture that checks, after every
// test and every fault point, that nothing of the sort outlives it, a sort
// whose callbacks can fail at any call, record sets with a known order, and
// the choice of fault points to try.
#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "alloc_counter.h"
#include "isort/host/errhub.h"
#include "isort/sortfile.h"
#include "sort_harness.h"

namespace faults {

using testing_support::Key;

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

// The callbacks of one sort over `records`, and what they saw. The output
// is sized beforehand, so the callbacks allocate nothing and every
// allocation counted during a sort is the sort's own.
struct CallLog {
  explicit CallLog(const Records& r) : records(r), output(r.count * r.nvars) {}
  const OBS* Get();             // the next input record; null at the end
  void Put(const OBS* record);  // takes an output record
  bool Prefix() const;          // what was put is the start of the oracle's order
  bool Complete() const { return puts == records.count && !overflow && Prefix(); }

  const Records& records;
  std::vector<OBS> output;         // delivered records, back to back
  std::size_t gets = 0, puts = 0;  // calls; the final Get() (null) included
  // Run with the 0-based number of each call before it does anything; may
  // throw (set `threw` first).
  std::function<void(std::size_t call)> beforeGet, beforePut;
  bool threw = false;             // a hook threw
  bool calledAfterThrow = false;  // a callback ran after that
  bool overflow = false;          // more records came out than went in
};

// A FileSort whose callbacks are a CallLog's.
class HookedSort : public FileSort {
 public:
  explicit HookedSort(CallLog& log, Statistics* stats = nullptr)
      : FileSort(log.records.keys, log.records.nvars, stats), log_(log) {}
  const OBS* GetRecord() override { return log_.Get(); }
  void PutRecord(const OBS* record) override { log_.Put(record); }
  FileSort::Data& data() { return FileSortAccess::DataOf(*this); }

 private:
  CallLog& log_;
};

// Kilobytes of records spill into several runs and at least two merge
// passes: the memory target below its public floor, small stream buffers.
void MakeItSpill(FileSort& sort);

// How one sort ended; Foreign: a ForeignFailure, a type no part of the
// system knows.
enum class Ending { Completed, BadAlloc, Error, GoToCaller, Foreign, Other };
const char* Name(Ending e);
struct ForeignFailure {
  int code;
};
// The exception in flight (call from a catch block); an ErrorText's text
// goes to *text.
Ending CurrentEnding(std::string* text = nullptr);
Ending RunSort(FileSort& sort, std::string* text = nullptr);

// Builds a HookedSort over the log's records, lets `setup` adjust it, and
// sorts; a failure to build it is an ending too.
template <class Setup>
Ending SortWith(CallLog& log, Setup setup, std::string* text = nullptr,
                FileSort::Statistics* stats = nullptr) {
  try {
    HookedSort sort(log, stats);
    setup(sort);
    return RunSort(sort, text);
  } catch (...) {
    return CurrentEnding(text);
  }
}

// SORTFILE's key array for the record set's keys.
std::vector<FortranInt> SortFileKeys(const Records& r);
// Calls SORTFILE with the log's callbacks. Returns its code, or -1 when an
// exception left it (*ending says which).
FortranInt CallSortFile(CallLog& log, const std::vector<FortranInt>& ukeys, Ending* ending);
// Whether a fault-free SORTFILE over the records reads temporary files back.
bool SortFileSpills(const Records& r);

// True when `output` holds every input record exactly once, bit for bit
// (records are told apart by their position in value 1), in any order.
bool IsPermutationOfInput(const Records& records, const std::vector<OBS>& output);

// What a sort may hold while it runs and must give back when it is gone:
// counted bytes, entries of /proc/self/fd and of /proc/self/task.
struct Resources {
  std::int64_t liveBytes = 0;
  int openFiles = 0, threads = 0;
};

// The fixture of every fault test. Before the test: a private temporary
// directory with a file of the test's own (SortTest), and the process's
// resources. After every fault point (ExpectReleased) and after the test:
// the directory holds nothing of the sort's, and the resources are back
// where they were; after the test, a fresh sort still matches the oracle.
class FaultTest : public testing_support::SortTest {
 protected:
  static void SetUpTestSuite();
  void SetUp() override;
  void TearDown() override;

  Resources Now() const;
  // Reports (naming `what` and `point`, with a message built only on
  // failure, so the check allocates nothing) and returns false unless
  // everything `before` recorded is back.
  bool ExpectReleased(const Resources& before, const char* what, std::uint64_t point);

  Resources atStart_;
};

}  // namespace faults
