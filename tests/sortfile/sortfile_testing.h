// Shared pieces of the Fortran-interface tests: report capture, a private
// temporary directory, host settings that make small sorts spill to runs,
// and record sources and sinks behind SORTFILE's two callbacks.
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>
#include <mutex>
#include <random>
#include <string>
#include <vector>

#include "host/hostsettings.h"
#include "isort/sortfile.h"

namespace sortfile_testing {

// Seed for a randomised test: ISORT_TEST_SEED when set, else a fixed one;
// printed so that a failure can be replayed.
inline std::uint32_t TestSeed(std::uint32_t fallback) {
  const char* env = std::getenv("ISORT_TEST_SEED");
  const std::uint32_t seed =
      env ? static_cast<std::uint32_t>(std::strtoul(env, nullptr, 10)) : fallback;
  std::printf("seed %u (set ISORT_TEST_SEED to replay)\n", seed);
  return seed;
}

// Collects every report the host makes while it lives.
class ReportCapture {
 public:
  ReportCapture() {
    vexahost::SetReportSink([this](const std::string& message) {
      std::lock_guard<std::mutex> lock(mutex_);
      reports_.push_back(message);
    });
  }
  ~ReportCapture() { vexahost::SetReportSink(nullptr); }
  ReportCapture(const ReportCapture&) = delete;
  ReportCapture& operator=(const ReportCapture&) = delete;

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
    namespace fs = std::filesystem;
    std::random_device entropy;
    for (;;) {
      const fs::path candidate =
          fs::temp_directory_path() / ("isort-sortfile-" + std::to_string(entropy()));
      if (fs::create_directory(candidate)) {
        path_ = candidate.string();
        break;
      }
    }
    vexahost::SetTempDirectory(path_);
  }
  ~PrivateTempDirectory() {
    vexahost::SetTempDirectory("");
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  PrivateTempDirectory(const PrivateTempDirectory&) = delete;
  PrivateTempDirectory& operator=(const PrivateTempDirectory&) = delete;

  const std::string& Path() const { return path_; }
  // Names of the entries in the directory.
  std::vector<std::string> Entries() const {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(path_)) {
      names.push_back(entry.path().filename().string());
    }
    return names;
  }

 private:
  std::string path_;
};

// Sixteen workers on a machine of sixteen cores: each worker's share of the
// 100 MiB memory target is about 6.5 MiB, so a few hundred thousand small
// records make several runs and a merge.
class SmallBatches {
 public:
  SmallBatches() {
    vexahost::SetProcessorCounts(1, 16);
    vexahost::SetThreadSetting(16);
  }
  ~SmallBatches() {
    vexahost::SetProcessorCounts(0, 0);
    vexahost::SetThreadSetting(0);
  }
  SmallBatches(const SmallBatches&) = delete;
  SmallBatches& operator=(const SmallBatches&) = delete;
};

// The context behind SORTFILE's callbacks: records in, records out, and
// hooks that let a test fail a callback at a chosen record.
struct SortContext {
  FortranInt nvars = 0;
  std::vector<OBS> input;  // records back to back
  std::size_t nextInput = 0;
  std::vector<OBS> output;
  std::size_t inputCalls = 0;
  std::size_t outputCalls = 0;
  // Called before record k (0-based) is handed in or taken; may throw.
  std::function<void(std::size_t k)> beforeInput;
  // Decides the output function's result for record k (0-based).
  std::function<FortranInt(std::size_t k)> outputResult;
  // Records only counted, not kept (large sorts).
  bool keepOutput = true;

  std::size_t Records() const { return input.size() / static_cast<std::size_t>(nvars); }
};

inline FortranInt VEXA_STDCALL ContextInput(void* context, OBS* buffer, FortranInt* nvars) {
  SortContext& c = *static_cast<SortContext*>(context);
  const std::size_t k = c.inputCalls++;
  if (c.beforeInput) c.beforeInput(k);
  if (*nvars != c.nvars) ADD_FAILURE() << "input function got nvars " << *nvars;
  if (c.nextInput >= c.Records()) return 1;
  std::memcpy(buffer, &c.input[c.nextInput * c.nvars], sizeof(OBS) * c.nvars);
  ++c.nextInput;
  return 0;
}

inline FortranInt VEXA_STDCALL ContextOutput(void* context, const OBS* record, FortranInt* nvars) {
  SortContext& c = *static_cast<SortContext*>(context);
  const std::size_t k = c.outputCalls++;
  if (*nvars != c.nvars) ADD_FAILURE() << "output function got nvars " << *nvars;
  if (c.keepOutput) c.output.insert(c.output.end(), record, record + c.nvars);
  return c.outputResult ? c.outputResult(k) : 0;
}

// Result of one SORTFILE call, with what it left in arguments 10 and 11.
struct SortFileResult {
  FortranInt code;
  FortranInt arg10;
  FortranInt arg11;
};

// Runs SORTFILE over `context` with the key array `ukeys` (3n values).
inline SortFileResult RunSortFile(SortContext& context, const std::vector<FortranInt>& ukeys) {
  const FortranInt nukeys = static_cast<FortranInt>(ukeys.size() / 3);
  SortFileResult r{-1, 99, 98};
  r.code = SORTFILE(&context, ContextInput, ContextOutput, &context.nvars, ukeys.data(), &nukeys,
                    nullptr, nullptr, nullptr, &r.arg10, &r.arg11);
  return r;
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
  std::string bytes = text.substr(0, width);
  bytes.resize(width, ' ');
  std::memcpy(value, bytes.data(), width);
}
// The system-missing pattern of the stand-in host.
inline std::uint64_t MissingBits() { return Bits(vexahost::SystemMissing()); }

}  // namespace sortfile_testing
