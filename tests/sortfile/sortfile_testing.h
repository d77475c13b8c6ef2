// Shared pieces of the Fortran-interface tests: report capture, a private
// temporary directory, host settings that make small sorts spill to runs,
// key arrays with a stable-sort oracle, and values set as bit patterns.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <numeric>
#include <random>
#include <string>
#include <vector>

#include "host/hostsettings.h"
#include "isort/sortfile.h"

namespace sortfile_testing {

// ISORT_TEST_SEED when set, else `fallback`; printed so a failure can be replayed.
inline std::uint32_t TestSeed(std::uint32_t fallback) {
  const char* env = std::getenv("ISORT_TEST_SEED");
  const std::uint32_t seed =
      env ? static_cast<std::uint32_t>(std::strtoul(env, nullptr, 10)) : fallback;
  std::printf("seed %u (set ISORT_TEST_SEED to replay)\n", seed);
  return seed;
}

// Collects every report the host makes while it lives (workers report too).
class ReportCapture {
 public:
  ReportCapture() {
    vexahost::SetReportSink([this](const std::string& message) {
      std::lock_guard<std::mutex> lock(mutex_);
      reports_.push_back(message);
    });
  }
  ~ReportCapture() { vexahost::SetReportSink(nullptr); }
  std::vector<std::string> Reports() {
    std::lock_guard<std::mutex> lock(mutex_);
    return reports_;
  }

 private:
  std::mutex mutex_;
  std::vector<std::string> reports_;
};

// A fresh directory for the host's temporary files while it lives.
class PrivateTempDirectory {
 public:
  PrivateTempDirectory() {
    std::random_device entropy;
    do {
      path_ =
          std::filesystem::temp_directory_path() / ("isort-sortfile-" + std::to_string(entropy()));
    } while (!std::filesystem::create_directory(path_));
    vexahost::SetTempDirectory(path_.string());
  }
  ~PrivateTempDirectory() {
    vexahost::SetTempDirectory("");
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  std::string Path() const { return path_.string(); }
  bool Empty() const { return std::filesystem::is_empty(path_); }

 private:
  std::filesystem::path path_;
};

// Sixteen workers on sixteen cores: each worker's share of the memory target
// is about 6.5 MiB, so a few hundred thousand small records spill and merge.
struct SmallBatches {
  SmallBatches() {
    vexahost::SetProcessorCounts(1, 16);
    vexahost::SetThreadSetting(16);
  }
  ~SmallBatches() {
    vexahost::SetProcessorCounts(0, 0);
    vexahost::SetThreadSetting(0);
  }
};

// One key of a key array: 1-based variable, direction (> 0 ascending),
// width (0 numeric, else string bytes).
struct Key {
  FortranInt variable, direction, width;
};

// The key array's three blocks of n values.
inline std::vector<FortranInt> KeyArray(const std::vector<Key>& keys) {
  const std::size_t n = keys.size();
  std::vector<FortranInt> a(3 * n);
  for (std::size_t i = 0; i < n; ++i) {
    a[i] = keys[i].variable;
    a[n + i] = keys[i].direction;
    a[2 * n + i] = keys[i].width;
  }
  return a;
}

// `records` (nvars values each) sorted the straightforward way: numeric keys
// as doubles, string keys by unsigned bytes over their width, ties in input order.
inline std::vector<OBS> OracleSort(const std::vector<OBS>& records, FortranInt nvars,
                                   const std::vector<Key>& keys) {
  std::vector<std::size_t> order(records.size() / nvars);
  std::iota(order.begin(), order.end(), std::size_t{0});
  std::stable_sort(order.begin(), order.end(), [&](std::size_t a, std::size_t b) {
    for (const Key& k : keys) {
      const OBS* x = &records[a * nvars + k.variable - 1];
      const OBS* y = &records[b * nvars + k.variable - 1];
      int c;
      if (k.width == 0) {
        double u, v;
        std::memcpy(&u, x, 8);
        std::memcpy(&v, y, 8);
        c = u < v ? -1 : u > v ? 1 : 0;
      } else {
        c = std::memcmp(x, y, k.width);
      }
      if (c != 0) return k.direction > 0 ? c < 0 : c > 0;
    }
    return false;
  });
  std::vector<OBS> out;
  out.reserve(records.size());
  for (std::size_t i : order)
    out.insert(out.end(), &records[i * nvars], &records[i * nvars] + nvars);
  return out;
}

inline bool SameBits(const std::vector<OBS>& a, const std::vector<OBS>& b) {
  return a.size() == b.size() && (a.empty() || std::memcmp(a.data(), b.data(), a.size() * sizeof(OBS)) == 0);
}

// Values are set and read as bit patterns through pointers, never returned
// as doubles: on i686 a double result passes through an x87 register, which
// would quiet a signaling NaN.
inline std::uint64_t Bits(const OBS* value) {
  std::uint64_t bits;
  std::memcpy(&bits, value, sizeof bits);
  return bits;
}
inline void SetBits(OBS* value, std::uint64_t bits) { std::memcpy(value, &bits, sizeof bits); }
inline void SetDouble(OBS* value, double d) { std::memcpy(value, &d, sizeof d); }
// `width` bytes of blank-padded text from `value` on (a string spans values).
inline void SetText(OBS* value, const std::string& text, std::size_t width) {
  std::string bytes = text;
  bytes.resize(width, ' ');
  std::memcpy(value, bytes.data(), width);
}
// The system-missing pattern of the stand-in host.
inline std::uint64_t MissingBits() { return Bits(vexahost::SystemMissing()); }

}  // namespace sortfile_testing
