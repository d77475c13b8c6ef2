// Test support for the isort tool: running the built program, private
// directories, and an oracle for delimited text written apart from the
// tool's reader (a plain byte-by-byte state machine) with a stable sort.
#pragma once

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
bool FileExists(const std::string& path);
// Names in a directory, hidden ones included ("." and ".." excluded), sorted.
std::vector<std::string> ListDir(const std::string& path);

struct ToolResult {
  int exitCode = -1;     // -1 when killed by a signal
  int signal = 0;
  std::string out;       // standard output
  std::string err;       // standard error
};

struct ToolRun {
  ToolRun(std::vector<std::string> a, std::string in = std::string()) : args(std::move(a)), stdinPath(std::move(in)) {}
  std::vector<std::string> args;  // after the program name
  std::string stdinPath;          // empty: /dev/null
  std::uint64_t fileSizeLimit = 0;  // > 0: RLIMIT_FSIZE, writes past it fail
};

// Runs the built isort with `run` and waits for it.
ToolResult RunTool(const ToolRun& run);

// One row of delimited text as the oracle reads it.
struct OracleRow {
  std::string raw;                  // the row's bytes, terminator included
  std::vector<std::string> fields;  // values, quotes removed
};
// Throws std::runtime_error on an unterminated quote.
std::vector<OracleRow> OracleParse(const std::string& text, char delimiter, bool quoting);

struct OracleKey {
  unsigned column;  // 0-based
  bool numeric;
  int direction;    // +1 / -1
};
// The expected output of sorting `text` (header first if `header`): rows
// stably sorted by `keys`, each keeping its bytes; the input's last row, if
// it had no terminator, gets the predominant one, and the output ends with a
// terminator exactly when the input did.
std::string OracleSort(const std::string& text, bool header, char delimiter, bool quoting,
                       const std::vector<OracleKey>& keys);
// A numeric key's value: surrounding blanks and a leading '+' allowed, the
// rest must be a decimal number; anything else is the missing value.
double OracleNumber(const std::string& field);

// Fixed-width binary records sorted stably by keys (numeric: doubles;
// string: bytes over `width`), as raw bytes.
struct OracleBinaryKey {
  unsigned value;   // 0-based
  unsigned width;   // 0: numeric
  int direction;
};
std::string OracleSortBinary(const std::string& records, unsigned nvars, const std::vector<OracleBinaryKey>& keys);

}  // namespace clitest
