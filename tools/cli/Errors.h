// The tool's failures and the exit codes they map to.
//
// Exit codes: 0 success; 1 a data, I/O or sort failure (bad input, an
// unwritable file, a full temporary directory, out of memory); 2 bad usage
// (unknown option, bad key syntax, unknown column). Each failure is reported
// as one line on standard error.
#pragma once

#include <stdexcept>
#include <string>

namespace isortcli {

enum ExitCode { kExitOk = 0, kExitFailure = 1, kExitUsage = 2 };

// Bad command line: an unknown option, a malformed value, a column that the
// input does not have.
class UsageError : public std::runtime_error {
 public:
  explicit UsageError(const std::string& message) : std::runtime_error(message) {}
};

// Input that cannot be sorted as asked (an unterminated quote, a string key
// wider than its declared width, a truncated binary record) or a file that
// cannot be read or written. The message names the place: file, line, column.
class DataError : public std::runtime_error {
 public:
  explicit DataError(const std::string& message) : std::runtime_error(message) {}
};

}  // namespace isortcli
