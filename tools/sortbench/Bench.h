// The sort engine benchmark: one workload measured four ways in the same
// run, each in a process of its own.
//
//   FileSort      the external sort, records made by GetRecord() and checked
//                 by PutRecord() (order, stability, checksum);
//   pass-through  the same records through the same two callbacks, unsorted:
//                 the floor of any sort through this interface;
//   stable_sort   every record read through the same generator into one
//                 vector, std::stable_sort with the same keys, delivered to
//                 the same consumer;
//   I/O floor     the pass-through plus one sequential write and one read of
//                 all records through a temporary file in large blocks: what
//                 a sort that touches the disk once cannot beat.
//
// Printed: seconds, records per second, peak resident memory, and the
// ratios the engine is held to (FileSort / stable_sort <= 0.7, FileSort /
// I/O floor <= 2.7, peak RSS above the empty process <= target + 40 MiB).
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>

#include "Measure.h"
#include "Workloads.h"

namespace sortbench {

struct BenchConfig {
  Workload workload = Workload::W1;
  std::uint64_t records = 2000000;
  unsigned values = 10;
  std::uint64_t memory = 0;  // 0: the sort's default target
  unsigned threads = 0;      // 0: the host's default
  unsigned repeat = 1;       // each measurement's best of this many runs
  std::string tmpdir;        // empty: the host's temporary directory
  bool announceRows = false; // tell the sort the record count (SetNRows), which
                             // lets an input that fits run on one thread
};

// The values a record may have for the stable_sort baseline.
constexpr unsigned kMinValues = 2;
constexpr unsigned kMaxValues = 32;

struct WorkloadResult {
  Measurement fileSort, passThrough, stableSort, ioFloor;
  std::uint64_t baselineRss = 0;
  std::uint64_t memoryTarget = 0;
  bool correct = false;        // every measurement delivered every record, FileSort in order
  bool meetsTargets = false;
};

// Runs the four measurements of `config` and prints their table to `out`.
WorkloadResult RunWorkload(const BenchConfig& config, std::FILE* out);

// The individual measurements (each runs in the calling process).
void MeasureFileSort(const BenchConfig& config, Measurement& m);
void MeasurePassThrough(const BenchConfig& config, Measurement& m);
void MeasureStableSort(const BenchConfig& config, Measurement& m);
void MeasureIoFloor(const BenchConfig& config, Measurement& m);

// "123.4 MiB"
std::string Mib(double bytes);

}  // namespace sortbench
