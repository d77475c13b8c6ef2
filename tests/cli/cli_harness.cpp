#include "cli_harness.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cfloat>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace clitest {
namespace {

void RemoveTree(const std::string& path) {
  DIR* dir = ::opendir(path.c_str());
  if (dir) {
    while (dirent* entry = ::readdir(dir)) {
      const std::string name = entry->d_name;
      if (name == "." || name == "..") continue;
      const std::string child = path + "/" + name;
      struct stat st;
      if (::lstat(child.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) {
        ::chmod(child.c_str(), 0700);
        RemoveTree(child);
      } else {
        ::unlink(child.c_str());
      }
    }
    ::closedir(dir);
  }
  ::rmdir(path.c_str());
}

}  // namespace

TempDir::TempDir() {
  const char* base = std::getenv("TMPDIR");
  std::string pattern = std::string(base && *base ? base : "/tmp") + "/isort-cli-test-XXXXXX";
  if (!::mkdtemp(&pattern[0])) throw std::runtime_error("mkdtemp failed");
  path_ = pattern;
}

TempDir::~TempDir() { RemoveTree(path_); }

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

void WriteFile(const std::string& path, const std::string& data) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(data.data(), static_cast<std::streamsize>(data.size()));
}

bool FileExists(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0;
}

std::vector<std::string> ListDir(const std::string& path) {
  std::vector<std::string> names;
  DIR* dir = ::opendir(path.c_str());
  if (!dir) return names;
  while (dirent* entry = ::readdir(dir)) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
  }
  ::closedir(dir);
  std::sort(names.begin(), names.end());
  return names;
}

ToolResult RunTool(const ToolRun& run) {
  TempDir io;
  const std::string outPath = io / "stdout", errPath = io / "stderr";
  const pid_t pid = ::fork();
  if (pid == 0) {
    const int in = ::open(run.stdinPath.empty() ? "/dev/null" : run.stdinPath.c_str(), O_RDONLY);
    const int out = ::open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    const int err = ::open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (in < 0 || out < 0 || err < 0) ::_exit(125);
    ::dup2(in, 0);
    ::dup2(out, 1);
    ::dup2(err, 2);
    if (run.fileSizeLimit != 0) {
      // Writes past the limit then fail with EFBIG instead of killing.
      ::signal(SIGXFSZ, SIG_IGN);
      struct rlimit limit;
      limit.rlim_cur = limit.rlim_max = run.fileSizeLimit;
      ::setrlimit(RLIMIT_FSIZE, &limit);
    }
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(ISORT_TOOL_PATH));
    for (const std::string& a : run.args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    ::execv(ISORT_TOOL_PATH, argv.data());
    ::_exit(127);
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  ToolResult result;
  if (WIFEXITED(status)) {
    result.exitCode = WEXITSTATUS(status);
  } else if (WIFSIGNALED(status)) {
    result.signal = WTERMSIG(status);
  }
  result.out = ReadFile(outPath);
  result.err = ReadFile(errPath);
  return result;
}

std::vector<OracleRow> OracleParse(const std::string& text, char delimiter, bool quoting) {
  enum State { FieldStart, Quoted, Plain };
  std::vector<OracleRow> rows;
  std::size_t i = 0;
  const std::size_t n = text.size();
  while (i < n) {
    OracleRow row;
    const std::size_t start = i;
    row.fields.emplace_back();
    State state = FieldStart;
    bool plainCr = false;  // the field's last byte is a CR outside quotes
    bool ended = false;
    while (i < n && !ended) {
      const char c = text[i];
      if (state == Quoted) {
        if (c == '"') {
          if (i + 1 < n && text[i + 1] == '"') {
            row.fields.back() += '"';
            i += 2;
          } else {
            state = Plain;
            ++i;
          }
        } else {
          row.fields.back() += c;
          ++i;
        }
        plainCr = false;
        continue;
      }
      if (state == FieldStart && quoting && c == '"') {
        state = Quoted;
        ++i;
        continue;
      }
      state = Plain;
      if (c == delimiter) {
        row.fields.emplace_back();
        state = FieldStart;
        plainCr = false;
      } else if (c == '\n') {
        if (plainCr) row.fields.back().pop_back();
        ended = true;
      } else {
        row.fields.back() += c;
        plainCr = c == '\r';
      }
      ++i;
    }
    if (!ended && state == Quoted) throw std::runtime_error("unterminated quote");
    row.raw = text.substr(start, i - start);
    rows.push_back(row);
  }
  return rows;
}

double OracleNumber(const std::string& field) {
  std::size_t b = 0, e = field.size();
  while (b < e && (field[b] == ' ' || field[b] == '\t')) ++b;
  while (e > b && (field[e - 1] == ' ' || field[e - 1] == '\t')) --e;
  std::string t = field.substr(b, e - b);
  if (t.size() > 1 && t[0] == '+') t.erase(0, 1);
  if (t.empty() || std::isspace(static_cast<unsigned char>(t[0]))) return -DBL_MAX;
  if (t.find('x') != std::string::npos || t.find('X') != std::string::npos) return -DBL_MAX;
  errno = 0;
  char* end = nullptr;
  const double d = std::strtod(t.c_str(), &end);
  if (end != t.c_str() + t.size() || errno == ERANGE || std::isnan(d)) return -DBL_MAX;
  return d < -DBL_MAX ? -DBL_MAX : d;
}

namespace {

std::string Terminator(const std::string& raw) {
  if (raw.size() >= 2 && raw.compare(raw.size() - 2, 2, "\r\n") == 0) return "\r\n";
  if (!raw.empty() && raw.back() == '\n') return "\n";
  return "";
}

}  // namespace

std::string OracleSort(const std::string& text, bool header, char delimiter, bool quoting,
                       const std::vector<OracleKey>& keys) {
  std::vector<OracleRow> rows = OracleParse(text, delimiter, quoting);
  std::size_t crlf = 0, lf = 0;
  for (const OracleRow& row : rows) {
    const std::string t = Terminator(row.raw);
    crlf += t == "\r\n";
    lf += t == "\n";
  }
  const std::string predominant = crlf > lf ? "\r\n" : "\n";
  const auto first = rows.begin() + (header && !rows.empty() ? 1 : 0);
  std::stable_sort(first, rows.end(), [&keys](const OracleRow& a, const OracleRow& b) {
    for (const OracleKey& key : keys) {
      const std::string none;
      const std::string& x = key.column < a.fields.size() ? a.fields[key.column] : none;
      const std::string& y = key.column < b.fields.size() ? b.fields[key.column] : none;
      int c = 0;
      if (key.numeric) {
        const double u = OracleNumber(x), v = OracleNumber(y);
        c = u < v ? -1 : (u > v ? 1 : 0);
      } else {
        c = x.compare(y);
        c = c < 0 ? -1 : (c > 0 ? 1 : 0);
      }
      if (c != 0) return c * key.direction < 0;
    }
    return false;
  });
  const bool endsWithTerminator = text.empty() || text.back() == '\n';
  std::string out;
  for (std::size_t i = 0; i < rows.size(); ++i) {
    const std::string t = Terminator(rows[i].raw);
    out += rows[i].raw.substr(0, rows[i].raw.size() - t.size());
    if (i + 1 < rows.size() || endsWithTerminator) out += t.empty() ? predominant : t;
  }
  return out;
}

std::string OracleSortBinary(const std::string& records, unsigned nvars, const std::vector<OracleBinaryKey>& keys) {
  const std::size_t size = std::size_t{nvars} * 8;
  std::vector<std::string> list;
  for (std::size_t at = 0; at + size <= records.size(); at += size) list.push_back(records.substr(at, size));
  std::stable_sort(list.begin(), list.end(), [&keys](const std::string& a, const std::string& b) {
    for (const OracleBinaryKey& key : keys) {
      int c = 0;
      if (key.width == 0) {
        double x, y;
        std::memcpy(&x, a.data() + key.value * 8, 8);
        std::memcpy(&y, b.data() + key.value * 8, 8);
        c = x < y ? -1 : (x > y ? 1 : 0);
      } else {
        c = std::memcmp(a.data() + key.value * 8, b.data() + key.value * 8, key.width);
        c = c < 0 ? -1 : (c > 0 ? 1 : 0);
      }
      if (c != 0) return c * key.direction < 0;
    }
    return false;
  });
  std::string out;
  for (const std::string& r : list) out += r;
  return out;
}

}  // namespace clitest
