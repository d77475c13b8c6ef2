// Helpers shared by the sort's tests: a FileSort over vectors, record
// generators with awkward bit patterns, an independent oracle, and a private
// temporary directory that must be empty again after each test.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "FileSortInternal.h"
#include "host/hostsettings.h"

namespace testing_support {

using Key = FileSort::SortKey;

inline OBS FromBits(std::uint64_t bits) {
  OBS v;
  std::memcpy(&v, &bits, sizeof v);
  return v;
}
inline std::uint64_t Bits(OBS v) {
  std::uint64_t b;
  std::memcpy(&b, &v, sizeof b);
  return b;
}
inline OBS FromText(const char* eight) {
  OBS v;
  std::memcpy(&v, eight, sizeof v);
  return v;
}

// Values that must come back bit for bit: signaling and quiet NaNs, -0.0,
// infinities, the system-missing value, blanks, text, small integers.
inline OBS AwkwardValue(std::mt19937_64& rng) {
  switch (rng() % 12) {
    case 0: return FromBits(0x7FF0000000000001ull);  // signaling NaN
    case 1: return FromBits(0xFFF4000000000123ull);  // signaling NaN, sign set
    case 2: return FromBits(0x7FF8000000000000ull);  // quiet NaN
    case 3: return FromBits(0x8000000000000000ull);  // -0.0
    case 4: return *vexahost::SystemMissing();
    case 5: return FromText("        ");
    case 6: return FromText("ABCDEFGH");
    case 7: return static_cast<double>(static_cast<int>(rng() % 300) - 120);
    case 8: return FromBits(0x7FF0000000000000ull);  // +inf
    default: return FromBits(rng());
  }
}

// The order the sort must produce, computed from whole records: keys
// compared in turn (numbers as doubles, strings as unsigned bytes),
// directions applied, ties in input order. REQUIRES: no NaN in numeric keys.
inline int OracleCompare(const OBS* a, const OBS* b, const std::vector<Key>& keys) {
  for (const Key& k : keys) {
    int r;
    if (k.width == 0) {
      double x, y;
      std::memcpy(&x, a + k.variable, 8);
      std::memcpy(&y, b + k.variable, 8);
      r = x < y ? -1 : x > y ? 1 : 0;
    } else {
      r = std::memcmp(a + k.variable, b + k.variable, k.width);
      r = r < 0 ? -1 : r > 0 ? 1 : 0;
    }
    if (r != 0) return r * k.direction;
  }
  return 0;
}

inline std::vector<OBS> OracleSort(const std::vector<OBS>& input, std::size_t records,
                                   unsigned nvars, const std::vector<Key>& keys) {
  std::vector<std::size_t> order(records);
  for (std::size_t i = 0; i < records; ++i) order[i] = i;
  std::stable_sort(order.begin(), order.end(), [&](std::size_t x, std::size_t y) {
    return OracleCompare(&input[x * nvars], &input[y * nvars], keys) < 0;
  });
  std::vector<OBS> out;
  out.reserve(records * nvars);
  for (std::size_t i : order) out.insert(out.end(), &input[i * nvars], &input[i * nvars] + nvars);
  return out;
}

inline bool SameBits(const std::vector<OBS>& a, const std::vector<OBS>& b) {
  return a.size() == b.size() && (a.empty() || std::memcmp(a.data(), b.data(), a.size() * 8) == 0);
}

// A FileSort over a vector of records. Hooks run before a record is handed
// out or taken, with its index, so tests can throw at record k.
class VectorSort : public FileSort {
 public:
  VectorSort(const std::vector<Key>& keys, unsigned nvars, const std::vector<OBS>* input,
             std::size_t records, Statistics* stats = nullptr)
      : FileSort(keys, nvars, stats), nvars_(nvars), input_(input), records_(records) {}

  const OBS* GetRecord() override {
    ++getCalls;
    if (next_ == records_) return nullptr;
    if (onGet) onGet(next_);
    const std::size_t i = next_++;
    return nvars_ == 0 ? &dummy_ : &(*input_)[i * nvars_];
  }
  void PutRecord(const OBS* record) override {
    if (onPut) onPut(delivered);
    if (lastPut && lastPut != record) sameBuffer = false;
    lastPut = record;
    output.insert(output.end(), record, record + nvars_);
    ++delivered;
  }
  // Lowers the memory target below the public floor so that kilobytes of
  // records make several runs and passes.
  void ForceMemoryTarget(std::uint32_t bytes) { FileSortAccess::DataOf(*this).memoryTarget = bytes; }
  FileSort::Data& data() { return FileSortAccess::DataOf(*this); }

  std::function<void(std::size_t)> onGet;
  std::function<void(std::size_t)> onPut;
  std::vector<OBS> output;
  std::size_t delivered = 0;
  std::size_t getCalls = 0;
  const OBS* lastPut = nullptr;
  bool sameBuffer = true;

 private:
  unsigned nvars_;
  const std::vector<OBS>* input_;
  std::size_t records_;
  std::size_t next_ = 0;
  OBS dummy_ = 0;
};

// A private temporary directory for the sort's files, with a file of the
// test's own in it that must survive; the directory must hold nothing else
// when the test ends. Host settings are restored.
class SortTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;
  // Entries of the temporary directory other than the test's own file.
  std::vector<std::string> Leftovers() const;
  // Fixes the thread count the sort chooses when no row count is given.
  static void UseThreads(unsigned n);

  std::string tempDir_;
};

}  // namespace testing_support
