// End-to-end runs of the built isort tool, checked against the oracle of
// cli_harness (its own reader and a stable sort).
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "cli_harness.h"

namespace clitest {
namespace {

std::string Pick(std::mt19937_64& rng, const std::vector<std::string>& options) {
  return options[rng() % options.size()];
}

std::string RandomText(std::mt19937_64& rng, char delimiter) {
  static const std::vector<std::string> pieces = {"a", "b", "ab", "abc", "Z", " ", "x y", "\"", "\"\"", "\n",
                                                  "\r\n", "\r", "é", "0", "9"};
  std::string s;
  for (int n = static_cast<int>(rng() % 5); n > 0; --n) s += Pick(rng, pieces);
  if (rng() % 6 == 0) s += delimiter;
  return s;
}

// Numbers, and text the numeric keys take as missing (or do not, in some
// locales: "1,5"), out of range, or at the edges of the range.
std::string RandomNumber(std::mt19937_64& rng) {
  static const std::vector<std::string> fixed = {"", "", "n/a", "-0", "0", "+5", " 7 ", "1e3", "-2.5E-1", "inf",
                                                 "-inf", "3.", ".5", "nan", "1,5", "12abc", "-", "-1e308", "1e999",
                                                 "-1.8e308", "0x10"};
  if (rng() % 3 == 0) return Pick(rng, fixed);
  const long long v = static_cast<long long>(rng() % 41) - 20;
  return rng() % 2 ? std::to_string(v) : std::to_string(v) + "." + std::to_string(rng() % 100);
}

std::string Quote(const std::string& field, char delimiter, bool force) {
  bool need = force;
  for (char c : field) need = need || c == delimiter || c == '"' || c == '\n' || c == '\r';
  if (!need) return field;
  std::string q = "\"";
  for (char c : field) q += c == '"' ? "\"\"" : std::string(1, c);
  return q + "\"";
}

struct Format {
  bool header;
  char delimiter;
  bool quoting;  // false: tab-separated, quotes are data
};

const std::vector<std::string> kNames = {"id", "name", "amount", "note", "count"};

// Columns: id, a short string (ties), a number, free text, a small integer;
// line ends LF, CRLF or mixed; now and then a short row or no final line end.
std::string RandomTable(std::mt19937_64& rng, unsigned rows, const Format& f) {
  const bool mixedEnds = rng() % 2 == 0;
  const bool crlf = rng() % 3 == 0;
  auto end = [&]() { return mixedEnds ? (rng() % 2 ? "\r\n" : "\n") : (crlf ? "\r\n" : "\n"); };
  std::string text;
  if (f.header) {
    for (unsigned c = 0; c < kNames.size(); ++c) text += (c ? std::string(1, f.delimiter) : "") + kNames[c];
    text += end();
  }
  static const std::vector<std::string> names = {"", "a", "ab", "abc", "b", "ba", "B", "a b", "\"q\"", "x,y", "é"};
  for (unsigned r = 0; r < rows; ++r) {
    std::vector<std::string> fields = {std::to_string(r + 1), Pick(rng, names), RandomNumber(rng),
                                       RandomText(rng, f.delimiter), std::to_string(rng() % 4)};
    const std::size_t used = rng() % 25 == 0 ? 1 + rng() % fields.size() : fields.size();
    for (std::size_t c = 0; c < used; ++c) {
      if (c) text += f.delimiter;
      if (f.quoting) {
        text += Quote(fields[c], f.delimiter, rng() % 10 == 0);
      } else {
        for (char ch : fields[c]) text += ch == f.delimiter || ch == '\n' ? '_' : ch;
      }
    }
    if (r + 1 < rows || rng() % 3 != 0) text += end();
  }
  return text;
}

// Keys by name or number, numeric or string (unsized, or a width that
// holds the widest value), either direction, the direction at times implicit.
std::vector<std::string> RandomKeys(std::mt19937_64& rng, const std::string& text, const Format& f,
                                    std::vector<OracleKey>* keys) {
  std::vector<std::string> args;
  for (unsigned k = 1 + static_cast<unsigned>(rng() % 3); k > 0; --k) {
    const unsigned column = 1 + static_cast<unsigned>(rng() % 4);
    const bool numeric = column == 2 || column == 4 ? rng() % 4 != 0 : rng() % 6 == 0;
    const int direction = rng() % 2 ? 1 : -1;
    std::string key = f.header && rng() % 2 ? kNames[column] : std::to_string(column + 1);
    if (numeric) {
      key += ":n";
    } else if (rng() % 2) {
      const std::vector<OracleRow> rows = OracleParse(text, f.delimiter, f.quoting);
      std::size_t widest = 1;
      for (std::size_t i = f.header ? 1 : 0; i < rows.size(); ++i) {
        if (column < rows[i].fields.size()) widest = std::max(widest, rows[i].fields[column].size());
      }
      key += ":s" + std::to_string(widest + rng() % 3);
    } else if (rng() % 2) {
      key += ":s";
    }
    key += direction < 0 ? ":desc" : rng() % 2 ? ":asc" : "";
    args.insert(args.end(), {"-k", key});
    keys->push_back(OracleKey{column, numeric, direction});
  }
  return args;
}

std::uint64_t Seed() {
  const std::uint64_t seed = std::random_device{}();
  std::printf("seed %llu\n", static_cast<unsigned long long>(seed));
  return seed;
}

std::vector<std::string> Concat(std::vector<std::string> a, const std::vector<std::string>& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

class SortCli : public ::testing::Test {
 protected:
  TempDir dir;  // inputs and outputs
  TempDir tmp;  // the tool's temporary directory: must stay empty
  std::vector<std::string> Base() const { return {"sort", "--quiet", "-T", tmp.Path()}; }

  void ExpectNothingLeft(const std::vector<std::string>& expectedFiles) {
    EXPECT_EQ(ListDir(tmp.Path()), std::vector<std::string>());
    EXPECT_EQ(ListDir(dir.Path()), expectedFiles);
  }
};

TEST_F(SortCli, RandomTablesMatchTheOracle) {
  const std::uint64_t seed = Seed();
  std::mt19937_64 rng(seed);
  for (int iteration = 0; iteration < 60; ++iteration) {
    SCOPED_TRACE("seed " + std::to_string(seed) + ", iteration " + std::to_string(iteration));
    const bool tsv = iteration % 6 == 5;
    const Format f{iteration % 4 != 3, tsv ? '\t' : iteration % 6 == 2 ? ';' : ',', !tsv};
    const std::string text = RandomTable(rng, static_cast<unsigned>(rng() % 300), f);
    std::vector<OracleKey> keys;
    std::vector<std::string> args = Concat(Base(), RandomKeys(rng, text, f, &keys));
    WriteFile(dir / "in.csv", text);
    if (!f.header) args.push_back("--no-header");
    if (tsv) args.push_back("--tsv");
    if (f.delimiter == ';') args.insert(args.end(), {"-t", ";"});
    // Now and then, rows past 8 or 16 bytes go through the side file.
    if (iteration % 5 == 4) args.insert(args.end(), {"--row-capacity", iteration % 10 == 4 ? "8" : "16"});
    // Both ways of parsing: on the sort's threads and on a thread of their own.
    args.push_back(iteration % 2 ? "--parse-thread" : "--serial-parse");
    const bool piped = iteration % 3 == 1;  // standard input to standard output
    if (!piped) args.insert(args.end(), {dir / "in.csv", "-o", dir / "out.csv"});
    const ToolResult r = RunTool(args, piped ? dir / "in.csv" : "");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    EXPECT_EQ(piped ? r.out : ReadFile(dir / "out.csv"), OracleSort(text, f.header, f.delimiter, f.quoting, keys));
    ::unlink((dir / "out.csv").c_str());
    ExpectNothingLeft({"in.csv"});
  }
}

TEST_F(SortCli, EmptyInputsAndLineEndsMatchTheOracle) {
  const std::string texts[] = {"", "n,v\n", "n,v", "n,v\r\n", "n,v\r\n3,c\r\n1,a\n2,\"x\r\ny\"\r\n",
                               "n\r\n3\r\n2\n4\r\n1", "v\n5\n\nabc\n-1e308\n \n-inf\n7\n"};
  for (const std::string& text : texts) {
    for (int direction : {1, -1}) {
      WriteFile(dir / "in.csv", text);
      const ToolResult r =
          RunTool(Concat(Base(), {"-k", direction > 0 ? "1:n" : "1:n:desc", dir / "in.csv", "-o", dir / "out.csv"}));
      ASSERT_EQ(r.exitCode, 0) << r.err;
      EXPECT_EQ(ReadFile(dir / "out.csv"), OracleSort(text, true, ',', true, {{0, true, direction}})) << text;
    }
  }
  // Without a header, an empty input has no column to lack.
  WriteFile(dir / "in.csv", "");
  const ToolResult r = RunTool(Concat(Base(), {"--no-header", "-k", "3:n", dir / "in.csv"}));
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "");
}

TEST_F(SortCli, BinaryRecordsAreSortedBitForBit) {
  const std::uint64_t seed = Seed();
  std::mt19937_64 rng(seed);
  const unsigned nvars = 5;
  // Values 1 and 5, never keys: a signaling NaN, -0.0, -DBL_MAX, blanks.
  // Value 2 a numeric key, -0.0 tying with 0.0; values 3-4 string keys' bytes.
  const std::uint64_t awkward[] = {0x7FF0000000000001ull, 0x8000000000000000ull, 0xFFEFFFFFFFFFFFFFull,
                                   0x2020202020202020ull};
  std::string records;
  for (int i = 0; i < 3000; ++i) {
    const double key = rng() % 10 == 0 ? -0.0 : static_cast<double>(static_cast<int>(rng() % 50) - 25);
    std::uint64_t v[nvars] = {awkward[rng() % 4], 0, 0, 0, awkward[rng() % 4] ^ (rng() % 2)};
    std::memcpy(&v[1], &key, 8);
    for (int b = 0; b < 16; ++b) reinterpret_cast<char*>(&v[2])[b] = "AB\0\xff"[rng() % 4];
    records.append(reinterpret_cast<const char*>(v), sizeof v);
  }
  WriteFile(dir / "in.bin", records);
  for (int iteration = 0; iteration < 4; ++iteration) {
    const unsigned width = 1 + static_cast<unsigned>(rng() % 16);
    const int d1 = rng() % 2 ? 1 : -1, d2 = rng() % 2 ? 1 : -1;
    std::vector<std::string> keyArgs = {"-k", "3:s" + std::to_string(width) + (d1 < 0 ? ":desc" : ""), "-k",
                                        d2 < 0 ? "2:n:desc" : "2:n"};
    std::vector<OracleBinaryKey> keys = {{2, width, d1}, {1, 0, d2}};
    if (iteration % 2) {
      std::swap(keyArgs[1], keyArgs[3]);
      std::swap(keys[0], keys[1]);
    }
    std::vector<std::string> args = Concat(Concat(Base(), {"--nvars", "5"}), keyArgs);
    const bool piped = iteration < 2;
    if (!piped) args.insert(args.end(), {dir / "in.bin", "-o", dir / "out.bin"});
    const ToolResult r = RunTool(args, piped ? dir / "in.bin" : "");
    ASSERT_EQ(r.exitCode, 0) << r.err;
    EXPECT_TRUE((piped ? r.out : ReadFile(dir / "out.bin")) == OracleSortBinary(records, nvars, keys))
        << "seed " << seed << ", keys " << keyArgs[1] << " " << keyArgs[3];
  }
}

// Bad usage (exit code 2) and bad input or an unusable directory (1): one
// line on standard error, no output, nothing left in the temporary directory.
TEST_F(SortCli, FailuresGiveOneLineAndLeaveNothing) {
  auto fails = [this](std::vector<std::string> args, const std::string& input, int exitCode,
                      const std::string& message, std::uint64_t fileSizeLimit = 0) {
    SCOPED_TRACE(message);
    WriteFile(dir / "in.csv", input);
    args = Concat(Concat(Base(), args), {dir / "in.csv"});
    if (std::find(args.begin(), args.end(), "-o") == args.end()) args.insert(args.end(), {"-o", dir / "out.csv"});
    const ToolResult r = RunTool(args, "", fileSizeLimit);
    EXPECT_EQ(r.exitCode, exitCode) << r.err;
    EXPECT_NE(r.err.find(message), std::string::npos) << r.err;
    EXPECT_EQ(r.err.rfind("isort: ", 0), 0u) << r.err;
    EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
    ExpectNothingLeft({"in.csv"});
  };
  fails({"-k", "nope"}, "a,b\n1,2\n", 2, "unknown column 'nope'");
  fails({"-k", "3"}, "a,b\n1,2\n", 2, "the header has 2 columns");
  fails({"-k", "a:x"}, "a,b\n1,2\n", 2, "unknown column 'a:x'");
  fails({"-k", "a:s0"}, "a,b\n1,2\n", 2, "a string width must be from 1");
  fails({"-k", "x", "--no-header"}, "1,2\n", 2, "without a header, columns are numbers");
  fails({}, "a\n", 2, "no sort key");
  fails({"-k", "a", "--bogus"}, "a\n", 2, "unknown option '--bogus'");
  fails({"-k", "a", "-m", "lots"}, "a\n", 2, "bad size 'lots'");
  fails({"-k", "a"}, "a,b\n1,2\n3,\"x\n4,5\n", 1, "line 3: unterminated quote");
  fails({"-k", "b:s1"}, "a,b\n1,2\n3,45\n", 1,
        "line 3, column 2 (b): a value of 2 bytes is wider than the key's width of 1");
  fails({"--nvars", "5", "-k", "2:n"}, std::string(77, 'x'), 1, "not a whole number of 40-byte records");
  const std::string nowhere = dir / "missing-dir";
  fails({"-k", "a", "-T", nowhere}, "a\n1\n", 1, "cannot create the temporary file in " + nowhere);
  fails({"-k", "a", "-o", nowhere + "/out.csv"}, "a\n1\n", 1,
        "cannot create output " + nowhere + "/out.csv: No such file or directory");
  // Root writes anywhere; others are refused a read-only directory.
  TempDir other;
  const std::string readOnly = other / "ro";
  ::mkdir(readOnly.c_str(), 0500);
  if (::geteuid() != 0) {
    fails({"-k", "a", "-T", readOnly}, "a\n1\n", 1, "cannot create the temporary file in " + readOnly);
    fails({"-k", "a", "-o", readOnly + "/out.csv"}, "a\n1\n", 1, "cannot create output " + readOnly);
  }
  // A full temporary directory: every row is longer than the forced capacity
  // and goes to the side store; past 16 MiB (at the default memory target)
  // that is a file in the temporary directory, and the file size limit makes
  // its writes fail.
  std::string text = "a,b\n";
  for (int i = 0; i < 700000; ++i) text += std::to_string(i % 97) + ",some text that makes the row long\n";
  fails({"-k", "a:n", "--row-capacity", "8"}, text, 1,
        "cannot write the file for long rows in " + tmp.Path() + ": File too large", 256 * 1024);
}

TEST_F(SortCli, ReplacingAnOutputIsAtomicAndKeepsItsMode) {
  WriteFile(dir / "in.csv", "a\n2\n1\n");
  WriteFile(dir / "out.csv", "old\n");
  ::chmod((dir / "out.csv").c_str(), 0640);
  // A failed run leaves the old file as it was.
  ToolResult r = RunTool(Concat(Base(), {"-k", "a:s", "--tsv", "-k", "zz", dir / "in.csv", "-o", dir / "out.csv"}));
  EXPECT_EQ(r.exitCode, 2);
  EXPECT_EQ(ReadFile(dir / "out.csv"), "old\n");
  r = RunTool(Concat(Base(), {"-k", "a", dir / "in.csv", "-o", dir / "out.csv"}));
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(ReadFile(dir / "out.csv"), "a\n1\n2\n");
  struct stat st;
  ASSERT_EQ(::stat((dir / "out.csv").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0640u);
  // Sorting a file onto itself works: the input is read before the output appears.
  r = RunTool(Concat(Base(), {"-k", "a:n:desc", dir / "out.csv", "-o", dir / "out.csv"}));
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(ReadFile(dir / "out.csv"), "a\n2\n1\n");
  ExpectNothingLeft({"in.csv", "out.csv"});
}

TEST_F(SortCli, AKilledRunLeavesNothingBehind) {
  for (int sig : {SIGTERM, SIGINT, SIGKILL}) {
    SCOPED_TRACE(sig);
    WriteFile(dir / "out.csv", "old\n");
    int fds[2];
    ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
    const pid_t pid = StartTool(Concat(Base(), {"-k", "a:n", "-o", dir / "out.csv"}), fds[0], -1, -1);
    ::close(fds[0]);
    // Once a blocking write of more than a pipe holds returns, the tool is
    // reading its input, so its output and spool files exist.
    std::string chunk = "a\n";
    while (chunk.size() < (1u << 20)) chunk += std::to_string(chunk.size() % 1000) + "\n";
    ASSERT_EQ(::write(fds[1], chunk.data(), chunk.size()), static_cast<ssize_t>(chunk.size()));
    ::kill(pid, sig);
    int status = 0;
    ::waitpid(pid, &status, 0);
    ::close(fds[1]);
    EXPECT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(ReadFile(dir / "out.csv"), "old\n");
    ExpectNothingLeft({"out.csv"});
  }
}

TEST(GenCli, SameSeedSameTableAndTheTableParses) {
  TempDir dir;
  for (const char* name : {"a", "b", "c"}) {
    ASSERT_EQ(RunTool({"gen", "--rows", "3000", "--seed", *name == 'c' ? "10" : "9", "-o", dir / name}).exitCode, 0);
  }
  const std::string a = ReadFile(dir / "a");
  EXPECT_EQ(a, ReadFile(dir / "b"));
  EXPECT_NE(a, ReadFile(dir / "c"));
  const std::vector<OracleRow> rows = OracleParse(a, ',', true);
  ASSERT_EQ(rows.size(), 3001u);
  bool quoted = false, missing = false;
  for (std::size_t i = 1; i < rows.size(); ++i) {
    ASSERT_EQ(rows[i].fields.size(), 9u) << rows[i].raw;
    quoted = quoted || rows[i].raw.find('"') != std::string::npos;
    missing = missing || rows[i].fields[5].empty();
  }
  EXPECT_TRUE(quoted);
  EXPECT_TRUE(missing);
  ASSERT_EQ(RunTool({"gen", "--binary", "--nvars", "6", "--rows", "100", "-o", dir / "d.bin"}).exitCode, 0);
  EXPECT_EQ(ReadFile(dir / "d.bin").size(), 100u * 6 * 8);
}

}  // namespace
}  // namespace clitest
