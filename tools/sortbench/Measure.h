// Measuring one run in a process of its own, so that its peak resident
// memory (the child's ru_maxrss from wait4) belongs to it alone.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace sortbench {

// What a measured body reports. Plain data: it crosses a pipe from the child.
struct Measurement {
  bool ok = false;
  char error[240] = {};       // why it failed, when !ok
  double seconds = 0;         // the body's own wall-clock time
  std::uint64_t records = 0;  // records delivered to the consumer
  std::uint64_t checksumIn = 0;
  std::uint64_t checksumOut = 0;
  std::uint64_t orderViolations = 0;
  std::uint64_t stabilityViolations = 0;
  // The sort's figures (FileSort runs only).
  std::uint32_t threads = 0;
  std::uint32_t runs = 0;
  std::uint32_t mergePasses = 0;
  std::uint64_t workFileBytes = 0;
  // Filled by the parent: the child's peak resident memory, in bytes.
  std::uint64_t peakRssBytes = 0;

  void Fail(const std::string& why);
};

// Runs `body` in a forked child (where processes cannot fork: in this
// process, and the peak is the process's so far) and returns its report
// with the peak resident memory. An exception or a crash in the child gives
// a report with ok == false.
Measurement MeasureInChild(const std::function<void(Measurement&)>& body);

struct CommandResult {
  int exitCode = -1;           // the program's exit code; -1 if it did not exit normally
  double seconds = 0;          // wall clock, from fork to exit
  std::uint64_t peakRssBytes = 0;
  std::string error;           // set when the program could not be run
};

// Runs a program (argv[0] is looked up in PATH) with `env` added to the
// environment ("NAME=value"), standard output to `stdoutPath` when not
// empty, standard error to `stderrPath` when not empty.
CommandResult MeasureCommand(const std::vector<std::string>& argv, const std::vector<std::string>& env,
                             const std::string& stdoutPath, const std::string& stderrPath = "");

// The resident memory of a child that does nothing: what every child
// starts with, to be subtracted from a measured peak.
std::uint64_t BaselineRssBytes();

// A nameless temporary file in `directory` for the I/O floor; -1 on failure.
int CreateScratchFile(const std::string& directory);

}  // namespace sortbench
