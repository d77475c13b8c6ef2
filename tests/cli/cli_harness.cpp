#include "cli_harness.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cfloat>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

namespace fs = std::filesystem;

namespace clitest {

TempDir::TempDir() {
  const char* base = std::getenv("TMPDIR");
  std::string pattern = std::string(base && *base ? base : "/tmp") + "/isort-cli-test-XXXXXX";
  if (!::mkdtemp(&pattern[0])) throw std::runtime_error("mkdtemp failed");
  path_ = pattern;
}

TempDir::~TempDir() {
  std::error_code ec;
  fs::remove_all(path_, ec);
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

void WriteFile(const std::string& path, const std::string& data) {
  std::ofstream(path, std::ios::binary | std::ios::trunc).write(data.data(), static_cast<std::streamsize>(data.size()));
}

std::vector<std::string> ListDir(const std::string& path) {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(path, ec)) names.push_back(entry.path().filename().string());
  std::sort(names.begin(), names.end());
  return names;
}

pid_t StartTool(const std::vector<std::string>& args, int in, int out, int err, std::uint64_t fileSizeLimit) {
  const pid_t pid = ::fork();
  if (pid != 0) return pid;
  const int null = ::open("/dev/null", O_RDWR);
  ::dup2(in < 0 ? null : in, 0);
  ::dup2(out < 0 ? null : out, 1);
  ::dup2(err < 0 ? null : err, 2);
  // An inherited "ignore" would keep a signal from ending the tool.
  ::signal(SIGINT, SIG_DFL);
  ::signal(SIGTERM, SIG_DFL);
  if (fileSizeLimit != 0) {
    ::signal(SIGXFSZ, SIG_IGN);
    const struct rlimit limit = {fileSizeLimit, fileSizeLimit};
    ::setrlimit(RLIMIT_FSIZE, &limit);
  }
  std::vector<char*> argv{const_cast<char*>(ISORT_TOOL_PATH)};
  for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  ::execv(ISORT_TOOL_PATH, argv.data());
  ::_exit(127);
}

ToolResult RunTool(const std::vector<std::string>& args, const std::string& stdinPath, std::uint64_t fileSizeLimit) {
  TempDir io;
  const int in = stdinPath.empty() ? -1 : ::open(stdinPath.c_str(), O_RDONLY | O_CLOEXEC);
  const int out = ::open((io / "out").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  const int err = ::open((io / "err").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
  const pid_t pid = StartTool(args, in, out, err, fileSizeLimit);
  for (int fd : {in, out, err}) {
    if (fd >= 0) ::close(fd);
  }
  int status = 0;
  while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  ToolResult result;
  if (WIFEXITED(status)) result.exitCode = WEXITSTATUS(status);
  result.out = ReadFile(io / "out");
  result.err = ReadFile(io / "err");
  return result;
}

std::vector<OracleRow> OracleParse(const std::string& text, char delimiter, bool quoting) {
  std::vector<OracleRow> rows;
  for (std::size_t i = 0, start = 0; i < text.size(); start = i) {
    OracleRow row{"", {""}};
    bool fieldStart = true, quoted = false, ended = false;
    bool plainCr = false;  // the field's last byte is a CR outside quotes
    for (; i < text.size() && !ended; ++i) {
      const char c = text[i];
      std::string& field = row.fields.back();
      if (quoted) {
        if (c != '"') {
          field += c;
        } else if (i + 1 < text.size() && text[i + 1] == '"') {
          field += text[i++];
        } else {
          quoted = false;
        }
      } else if (fieldStart && quoting && c == '"') {
        quoted = true;
      } else if (c == delimiter) {
        row.fields.emplace_back();
      } else if (c == '\n') {
        if (plainCr) field.pop_back();
        ended = true;
      } else {
        field += c;
      }
      fieldStart = !quoted && c == delimiter;
      plainCr = !quoted && c == '\r';
    }
    if (quoted) throw std::runtime_error("unterminated quote");
    row.raw = text.substr(start, i - start);
    rows.push_back(row);
  }
  return rows;
}

namespace {

double OracleNumber(const std::string& field) {
  std::size_t b = 0, e = field.size();
  while (b < e && (field[b] == ' ' || field[b] == '\t')) ++b;
  while (e > b && (field[e - 1] == ' ' || field[e - 1] == '\t')) --e;
  std::string t = field.substr(b, e - b);
  if (t.size() > 1 && t[0] == '+') t.erase(0, 1);
  if (t.empty() || std::isspace(static_cast<unsigned char>(t[0]))) return -DBL_MAX;
  if (t.find_first_of("xX") != std::string::npos) return -DBL_MAX;
  errno = 0;
  char* end = nullptr;
  const double d = std::strtod(t.c_str(), &end);
  if (end != t.c_str() + t.size() || errno == ERANGE || std::isnan(d)) return -DBL_MAX;
  return d < -DBL_MAX ? -DBL_MAX : d;
}

std::string Terminator(const std::string& raw) {
  if (raw.size() >= 2 && raw.compare(raw.size() - 2, 2, "\r\n") == 0) return "\r\n";
  return !raw.empty() && raw.back() == '\n' ? "\n" : "";
}

template <class T>
int Compare(T a, T b) {
  return a < b ? -1 : (b < a ? 1 : 0);
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
      const int c = key.numeric ? Compare(OracleNumber(x), OracleNumber(y)) : Compare(x.compare(y), 0);
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
      const char* x = a.data() + key.value * 8;
      const char* y = b.data() + key.value * 8;
      double u, v;
      std::memcpy(&u, x, 8);
      std::memcpy(&v, y, 8);
      const int c = key.width == 0 ? Compare(u, v) : Compare(std::memcmp(x, y, key.width), 0);
      if (c != 0) return c * key.direction < 0;
    }
    return false;
  });
  std::string out;
  for (const std::string& r : list) out += r;
  return out;
}

}  // namespace clitest
