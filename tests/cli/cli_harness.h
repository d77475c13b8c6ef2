// Test support for the isort tool: running the built program, private
// directories, and an oracle for delimited text written apart from the
// tool's reader (a plain byte-by-byte state machine) with a stable sort.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <vector>

namespace clitest {

// A fresh directory, removed with everything in it at destruction.
class TempDir {
 public:
  TempDir();
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;
  const std::string& Path() const { return path_; }
  std::string operator/(const std::string& name) const { return path_ + "/" + name; }

 private:
  std::string path_;
};

std::string ReadFile(const std::string& path);
void WriteFile(const std::string& path, const std::string& data);
// Names in a directory, hidden ones included, sorted.
std::vector<std::string> ListDir(const std::string& path);

// Starts the built isort with `args` (after the program name) on the given
// standard descriptors (-1: /dev/null), SIGINT and SIGTERM at their default.
// A `fileSizeLimit` sets RLIMIT_FSIZE: writes past it fail with EFBIG.
pid_t StartTool(const std::vector<std::string>& args, int in, int out, int err,
                std::uint64_t fileSizeLimit = 0);

struct ToolResult {
  int exitCode = -1;  // -1 when killed by a signal
  std::string out, err;
};
// Runs the tool to its end; standard input from `stdinPath` (empty: /dev/null).
ToolResult RunTool(const std::vector<std::string>& args, const std::string& stdinPath = "",
                   std::uint64_t fileSizeLimit = 0);

// One row of delimited text as the oracle reads it.
struct OracleRow {
  std::string raw;                  // the row's bytes, terminator included
  std::vector<std::string> fields;  // values, quotes removed
};
// Throws std::runtime_error on an unterminated quote.
std::vector<OracleRow> OracleParse(const std::string& text, char delimiter, bool quoting);

struct OracleKey {
  unsigned column;  // 0-based
  bool numeric;     // a decimal number, blanks and a leading '+' allowed; else missing, the lowest
  int direction;    // +1 / -1
};
// The expected output of sorting `text` (header first if `header`): rows
// stably sorted by `keys`, each keeping its bytes; the input's last row, if
// it had no terminator, gets the predominant one, and the output ends with a
// terminator exactly when the input did.
std::string OracleSort(const std::string& text, bool header, char delimiter, bool quoting,
                       const std::vector<OracleKey>& keys);

// Fixed-width binary records sorted stably by keys (width 0: a double;
// else that many bytes from the value on), as raw bytes.
struct OracleBinaryKey {
  unsigned value;  // 0-based
  unsigned width;
  int direction;
};
std::string OracleSortBinary(const std::string& records, unsigned nvars, const std::vector<OracleBinaryKey>& keys);

}  // namespace clitest
