// The --stats table: the sort library's statistics with what the tool adds.
#pragma once

#include <cstdint>
#include <cstdio>
#include <string>

#include "isort/FileSort.h"

namespace isortcli {

struct SortReport {
  std::string input;
  std::uint64_t inputBytes = 0;
  bool binary = false;
  unsigned nvars = 0;
  unsigned keyValues = 0;
  std::uint32_t rowCapacity = 0;   // text rows: row bytes held in the record
  std::uint64_t sideRows = 0;      // rows longer than the capacity
  std::uint64_t sideBytes = 0;
  std::uint64_t unparsable = 0;    // numeric key fields that were not numbers
  std::uint64_t memoryTarget = 0;  // as given to the library
  double firstPassSeconds = -1;    // < 0: no first pass
  double sortSeconds = 0;          // Sort(), wall clock
  double totalSeconds = 0;
};

void PrintStatistics(std::FILE* out, const FileSort::Statistics& stats, const SortReport& report);

// "1.23 GB", "512 B": bytes for people (powers of 1000 for data sizes).
std::string ShortBytes(double bytes);
// "10,000,000"
std::string Grouped(std::uint64_t n);

}  // namespace isortcli
