// The sort benchmark's workloads: records made on the fly from their index,
// so no measurement needs the whole input in memory unless it sorts there.
//
// Every record has `nvars` doubles (10 by default); its last value holds the
// record's index, which lets the consumer check stability.
//
//   W1  uniform random doubles; one ascending numeric key on value 0.
//   W2  values 1-2 hold a 16-byte string: 12 random capital letters and four
//       zero bytes; keys: that string (width 12) ascending, then value 5
//       (a uniform random double) descending.
//   W3  tie-heavy survey data: value 1 is one of 20 eight-letter words, value
//       2 an integer age from 18 to 90; keys: the word (width 8) ascending,
//       then the age descending. Other values are small integers (codes
//       from 1 to 9) and, at values 3 and 4, doubles.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "isort/FileSort.h"

namespace sortbench {

enum class Workload { W1, W2, W3 };

// "W1" -> Workload::W1; false for an unknown name.
bool ParseWorkload(const std::string& name, Workload* w);
const char* WorkloadName(Workload w);
const char* WorkloadDescription(Workload w);
// The fewest values a record of the workload can have.
unsigned MinimumValues(Workload w);
// The workload's keys, as FileSort takes them.
std::vector<FileSort::SortKey> WorkloadKeys(Workload w);

// Makes record `index` of a workload.
class RecordGenerator {
 public:
  RecordGenerator(Workload w, unsigned nvars, std::uint64_t seed = 42);
  void Make(std::uint64_t index, OBS* record) const;
  unsigned Nvars() const { return nvars_; }

 private:
  Workload workload_;
  unsigned nvars_;
  std::uint64_t seed_;
};

// A hash of one record's bits; summed over a set of records it gives a
// checksum that does not depend on their order.
std::uint64_t RecordHash(const OBS* record, unsigned nvars);

// Compares two records by keys as the sort does: numbers as doubles (a NaN
// equals anything), strings as unsigned bytes, each key times its direction.
int CompareByKeys(const std::vector<FileSort::SortKey>& keys, const OBS* a, const OBS* b);

// The consumer of every measurement: counts records, sums their hashes, and
// counts records that are out of key order or, among equal keys, out of
// input order (by the index in the last value).
class OrderChecker {
 public:
  OrderChecker(std::vector<FileSort::SortKey> keys, unsigned nvars);
  void Put(const OBS* record) {
    checksum_ += RecordHash(record, nvars_);
    if (count_++ != 0) Check(record);
    for (unsigned i = 0; i < nvars_; ++i) previous_[i] = record[i];
  }
  std::uint64_t Count() const { return count_; }
  std::uint64_t Checksum() const { return checksum_; }
  std::uint64_t OrderViolations() const { return order_; }
  std::uint64_t StabilityViolations() const { return stability_; }

 private:
  void Check(const OBS* record);
  std::vector<FileSort::SortKey> keys_;
  unsigned nvars_;
  std::vector<OBS> previous_;
  std::uint64_t count_ = 0;
  std::uint64_t checksum_ = 0;
  std::uint64_t order_ = 0;
  std::uint64_t stability_ = 0;
};

}  // namespace sortbench
