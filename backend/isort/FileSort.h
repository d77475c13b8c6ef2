// FileSort: an external, parallel, stable sort of fixed-width records.
//
// A record is `nvars` 8-byte values (OBS): doubles, or 8-byte pieces of
// strings (a string wider than 8 bytes spans consecutive values). A caller
// derives from FileSort, implements GetRecord() and PutRecord(), constructs it
// with the sort keys, optionally calls SetMemoryTarget() and SetNRows(), and
// calls Sort() once. Sort() returns when every record has been handed to
// PutRecord() in key order; records with equal keys keep their input order.
//
// Life cycle: constructed (setters allowed, the last value counts) -> Sort()
// -> finished or failed. The object sorts one input: a second Sort() after a
// successful one calls neither callback; after a failure it throws the same
// failure again. Temporary files live until the FileSort is destroyed.
//
// Threads: Sort() runs the input phase on worker threads. GetRecord() is
// never called by two threads at once, but successive calls may come from
// different threads. PutRecord() calls never overlap and come from one
// thread: the thread that called Sort(), or, when the whole input fitted in
// the first batch, the worker that sorted it.
//
// Memory: the memory target (at least and by default 100 MiB) bounds the
// batches that the workers sort in memory, shared evenly among them, and the
// number of runs that one merge pass reads at a time. An input whose
// estimated size, (nvars + 1) * 8 bytes per record, stays below the target
// is sorted in memory and never touches a file.
//
// Disk: a larger input is written once to temporary files as sorted runs
// (compressed, roughly the records' size) and read back by the merge; each
// merge pass that is not the last writes its runs' size again. The files are
// created in the host's temporary directory and removed with the FileSort.
//
// Failures: Sort() throws std::bad_alloc when memory runs out and ErrorText
// (the host's error record) when a stream or a callback fails with one; any
// other exception thrown by a callback leaves Sort() unchanged. Records
// handed to PutRecord() before a failure stay delivered. Keys that reach
// outside the record make the constructor throw ErrorText.
#pragma once

#include <cstdint>
#include <vector>

#include "isort/host/vexatypes.h"

#if defined(_WIN32) && defined(ISORT_STATIC)
#define ISORT_API
#elif defined(_WIN32)
#if defined(ISORT_BUILD)
#define ISORT_API __declspec(dllexport)
#else
#define ISORT_API __declspec(dllimport)
#endif
#else
#define ISORT_API __attribute__((visibility("default")))
#endif

class ISORT_API FileSort {
 public:
  // One sort key.
  struct SortKey {
    std::int32_t variable;   // 0-based index of the key's first value in the record
    std::int32_t direction;  // +1 ascending, -1 descending (multiplies each comparison)
    std::uint32_t width;     // 0: numeric (one value, a double); else a string of `width` bytes
  };

  // Counts and timings of a sort, owned by the caller. The sort adds to the
  // counters and appends to the vectors; it never resets them. Times are
  // differences of the host's clock readings (milliseconds: "1" CPU time,
  // "2" wall-clock time), wrapping at 32 bits.
  struct Statistics {
    struct RunInfo {            // one batch that held records
      std::uint32_t memoryShare;  // bytes of the memory target given to its worker
      std::uint32_t capacity;     // records the batch could hold
      std::uint32_t records;      // records read into it
      std::uint32_t readTime2;    // reading
      std::uint32_t sortTime2;    // sorting in memory
      std::uint32_t writeTime2;   // writing the run, or delivering it directly
    };
    struct MergeInfo {          // one merge pass
      std::uint64_t bytes;        // size of the run it wrote; 0 for the final pass
      std::uint32_t runs;         // runs it merged
      std::uint32_t time2;
      std::uint32_t time1;
    };

    std::uint64_t records = 0;        // records read
    std::uint64_t workFileBytes = 0;  // bytes the workers wrote to their temporary files
    std::uint32_t recordBytes = 0;    // bytes of a record as the sort stores it
    std::uint32_t runPhaseTime2 = 0;  // the input phase (reading, sorting, writing runs)
    std::uint32_t runPhaseTime1 = 0;
    std::uint32_t threads = 0;        // workers of the last Sort()
    std::vector<RunInfo> runs;
    std::vector<MergeInfo> merges;
  };

  class Data;
  class Sorter;
  class WorkFile;
  class KeyLayout;
  class KeyCompare;

  // `keys` are copied. `stats` may be null; it is not owned and must outlive
  // the FileSort. Throws ErrorText for a key outside the record, std::bad_alloc.
  FileSort(const std::vector<SortKey>& keys, unsigned int nvars, Statistics* stats);
  // Removes every temporary file and buffer the sort still holds.
  virtual ~FileSort();
  FileSort(const FileSort&) = delete;
  FileSort& operator=(const FileSort&) = delete;

  // The memory target in bytes; values below 104,857,600 (100 MiB) give that.
  void SetMemoryTarget(unsigned int bytes);
  // The expected number of records, or a negative value for "not given". It
  // only chooses the thread count; it never limits what is read.
  void SetNRows(std::int64_t rows);
  // Sorts: reads every record through GetRecord() and hands them to
  // PutRecord() in key order.
  void Sort();

  // The next input record (`nvars` values), or null at the end of the input.
  // The pointer must stay valid until the next call; the same buffer may be
  // returned every time. Not called again after it has returned null.
  virtual const OBS* GetRecord() = 0;
  // The next record in key order. `record` points at `nvars` values that
  // are valid only during the call (the same buffer every call): copy what
  // you keep.
  virtual void PutRecord(const OBS* record) = 0;

 private:
  friend struct FileSortAccess;  // internal code and tests
  Data* data;                    // owned; never null after construction
};
