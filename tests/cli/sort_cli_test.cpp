// End-to-end runs of the built isort tool, checked against the oracle of
// cli_harness (its own reader and a stable sort).
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cfloat>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "cli_harness.h"

namespace clitest {
namespace {

// --- random tables --------------------------------------------------------

std::string Pick(std::mt19937_64& rng, const std::vector<std::string>& options) {
  return options[rng() % options.size()];
}

std::string RandomText(std::mt19937_64& rng, char delimiter) {
  static const std::vector<std::string> pieces = {"a", "b", "ab", "abc", "Z", " ", "x y", "\"", "\"\"", "\n",
                                                  "\r\n", "\r", "é", "0", "9"};
  std::string s;
  const int n = static_cast<int>(rng() % 5);
  for (int i = 0; i < n; ++i) s += Pick(rng, pieces);
  if (rng() % 6 == 0) s += delimiter;
  return s;
}

std::string RandomNumber(std::mt19937_64& rng) {
  static const std::vector<std::string> fixed = {"", "", "n/a", "-0", "0", "+5", " 7 ", "1e3", "-2.5E-1",
                                                 "inf", "-inf", "3.", ".5", "nan", "1,5", "12abc", "-"};
  if (rng() % 3 == 0) return Pick(rng, fixed);
  const long long v = static_cast<long long>(rng() % 41) - 20;
  if (rng() % 2) return std::to_string(v);
  return std::to_string(v) + "." + std::to_string(rng() % 100);
}

std::string Quote(const std::string& field, char delimiter, bool force) {
  bool need = force;
  for (char c : field) need = need || c == delimiter || c == '"' || c == '\n' || c == '\r';
  if (!need) return field;
  std::string q = "\"";
  for (char c : field) {
    if (c == '"') q += '"';
    q += c;
  }
  return q + "\"";
}

struct Table {
  std::string text;
  std::vector<std::string> names;
  unsigned columns;
};

// Columns: id, a short string (ties), a number, free text, a small integer.
Table RandomTable(std::mt19937_64& rng, unsigned rows, bool header, char delimiter) {
  Table t;
  t.names = {"id", "name", "amount", "note", "count"};
  t.columns = 5;
  const bool mixedEnds = rng() % 2 == 0;
  const bool crlf = rng() % 3 == 0;
  auto end = [&]() { return mixedEnds ? (rng() % 2 ? "\r\n" : "\n") : (crlf ? "\r\n" : "\n"); };
  if (header) {
    for (unsigned c = 0; c < t.columns; ++c) t.text += (c ? std::string(1, delimiter) : "") + t.names[c];
    t.text += end();
  }
  static const std::vector<std::string> names = {"", "a", "ab", "abc", "b", "ba", "B", "a b", "\"q\"", "x,y", "é"};
  for (unsigned r = 0; r < rows; ++r) {
    std::vector<std::string> f = {std::to_string(r + 1), Pick(rng, names), RandomNumber(rng), RandomText(rng, delimiter),
                                  std::to_string(rng() % 4)};
    unsigned used = t.columns;
    if (rng() % 25 == 0) used = 1 + static_cast<unsigned>(rng() % t.columns);  // a short row
    std::string line;
    for (unsigned c = 0; c < used; ++c) {
      if (c) line += delimiter;
      line += Quote(f[c], delimiter, rng() % 10 == 0);
    }
    t.text += line;
    if (r + 1 < rows || rng() % 3 != 0) t.text += end();  // sometimes no final line end
  }
  return t;
}

// The widest value of a column, for declared widths.
std::size_t Widest(const std::string& text, unsigned column, bool header, char delimiter) {
  std::vector<OracleRow> rows = OracleParse(text, delimiter, true);
  std::size_t w = 0;
  for (std::size_t i = header ? 1 : 0; i < rows.size(); ++i) {
    if (column < rows[i].fields.size()) w = std::max(w, rows[i].fields[column].size());
  }
  return w;
}

struct Case {
  std::vector<std::string> keyArgs;
  std::vector<OracleKey> keys;
};

Case RandomKeys(std::mt19937_64& rng, const Table& t, bool header, char delimiter) {
  Case c;
  const unsigned nkeys = 1 + static_cast<unsigned>(rng() % 3);
  for (unsigned k = 0; k < nkeys; ++k) {
    const unsigned column = 1 + static_cast<unsigned>(rng() % 4);
    const bool numeric = column == 2 || column == 4 ? rng() % 4 != 0 : rng() % 6 == 0;
    const int direction = rng() % 2 ? 1 : -1;
    std::string spec = header && rng() % 2 ? t.names[column] : std::to_string(column + 1);
    if (numeric) {
      spec += ":n";
    } else if (rng() % 2) {
      spec += ":s" + std::to_string(std::max<std::size_t>(1, Widest(t.text, column, header, delimiter) + rng() % 3));
    } else if (rng() % 2) {
      spec += ":s";
    }
    if (direction < 0) {
      spec += ":desc";
    } else if (rng() % 2) {
      spec += ":asc";
    }
    c.keyArgs.push_back("-k");
    c.keyArgs.push_back(spec);
    c.keys.push_back(OracleKey{column, numeric, direction});
  }
  return c;
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
  TempDir dir;      // inputs and outputs
  TempDir tmp;      // the tool's temporary directory: must stay empty
  std::vector<std::string> Base() const { return {"sort", "--quiet", "-T", tmp.Path()}; }

  void ExpectNothingLeft(const std::vector<std::string>& expectedFiles) {
    EXPECT_EQ(ListDir(tmp.Path()), std::vector<std::string>());
    EXPECT_EQ(ListDir(dir.Path()), expectedFiles);
  }
};

// --- output against the oracle --------------------------------------------

TEST_F(SortCli, RandomTablesMatchTheOracle) {
  const std::uint64_t seed = Seed();
  std::mt19937_64 rng(seed);
  for (int iteration = 0; iteration < 40; ++iteration) {
    SCOPED_TRACE("seed " + std::to_string(seed) + ", iteration " + std::to_string(iteration));
    const bool header = iteration % 4 != 3;
    const char delimiter = iteration % 7 == 6 ? ';' : ',';
    const Table t = RandomTable(rng, static_cast<unsigned>(rng() % 300), header, delimiter);
    const Case c = RandomKeys(rng, t, header, delimiter);
    WriteFile(dir / "in.csv", t.text);
    std::vector<std::string> args = Concat(Base(), c.keyArgs);
    if (!header) args.push_back("--no-header");
    if (delimiter != ',') args.insert(args.end(), {"-t", std::string(1, delimiter)});
    // Now and then, rows past 8 or 16 bytes go through the side file.
    if (iteration % 5 == 4) args.insert(args.end(), {"--row-capacity", iteration % 10 == 4 ? "8" : "16"});
    // Both ways of parsing: on the sort's threads and on a thread of their own.
    args.push_back(iteration % 2 ? "--parse-thread" : "--serial-parse");
    args.insert(args.end(), {dir / "in.csv", "-o", dir / "out.csv"});
    const ToolResult r = RunTool({args});
    ASSERT_EQ(r.exitCode, 0) << r.err;
    EXPECT_EQ(ReadFile(dir / "out.csv"), OracleSort(t.text, header, delimiter, true, c.keys));
  }
  ExpectNothingLeft({"in.csv", "out.csv"});
}

TEST_F(SortCli, StandardInputToStandardOutputMatchesFiles) {
  std::mt19937_64 rng(Seed());
  const Table t = RandomTable(rng, 500, true, ',');
  WriteFile(dir / "in.csv", t.text);
  const ToolResult r = RunTool({Concat(Base(), {"-k", "note:s", "-k", "amount:n:desc"}), dir / "in.csv"});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, OracleSort(t.text, true, ',', true, {{3, false, 1}, {2, true, -1}}));
  ExpectNothingLeft({"in.csv"});
}

TEST_F(SortCli, TabSeparatedTakesQuotesAsData) {
  const std::string text = "k\tv\n\"b\tx\n\"a\ty\nc\"\tz\n";
  WriteFile(dir / "in.tsv", text);
  const ToolResult r = RunTool({Concat(Base(), {"--tsv", "-k", "k", dir / "in.tsv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "k\tv\n\"a\ty\n\"b\tx\nc\"\tz\n");
  EXPECT_EQ(r.out, OracleSort(text, true, '\t', false, {{0, false, 1}}));
}

TEST_F(SortCli, CrlfLineEndsAreKept) {
  const std::string text = "n,v\r\n3,c\r\n1,a\n2,\"x\r\ny\"\r\n";
  WriteFile(dir / "in.csv", text);
  const ToolResult r = RunTool({Concat(Base(), {"-k", "n:n", dir / "in.csv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "n,v\r\n1,a\n2,\"x\r\ny\"\r\n3,c\r\n");
}

TEST_F(SortCli, LastRowWithoutLineEndGetsThePredominantOne) {
  // The unterminated last row moves to the front; the new last row drops its
  // terminator, because the input ended without one.
  WriteFile(dir / "in.csv", "n\r\n3\r\n2\n4\r\n1");
  ToolResult r = RunTool({Concat(Base(), {"-k", "n:n", dir / "in.csv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "n\r\n1\r\n2\n3\r\n4");
  // Descending, the unterminated row stays last and the output is the input.
  r = RunTool({Concat(Base(), {"-k", "n:n:desc", dir / "in.csv"})});
  EXPECT_EQ(r.out, "n\r\n4\r\n3\r\n2\n1");
}

TEST_F(SortCli, EmptyInputAndHeaderOnly) {
  for (const std::string& text : {std::string(), std::string("a,b\n"), std::string("a,b"), std::string("a,b\r\n")}) {
    WriteFile(dir / "in.csv", text);
    const ToolResult r = RunTool({Concat(Base(), {"-k", "1", dir / "in.csv", "-o", dir / "out.csv"})});
    ASSERT_EQ(r.exitCode, 0) << r.err;
    EXPECT_EQ(ReadFile(dir / "out.csv"), text);
  }
  // Without a header, an empty input has no column to lack.
  WriteFile(dir / "in.csv", "");
  const ToolResult r = RunTool({Concat(Base(), {"--no-header", "-k", "3:n", dir / "in.csv"})});
  EXPECT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "");
}

TEST_F(SortCli, MissingNumbersSortLowestAscendingAndLastDescending) {
  const std::string text = "v\n5\n\nabc\n-1e308\n \n-inf\n7\n";
  WriteFile(dir / "in.csv", text);
  ToolResult r = RunTool({Concat(Base(), {"-k", "v:n", dir / "in.csv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  // Missing values (empty, text, blank) come before every number; -inf
  // sorts with them, in input order.
  EXPECT_EQ(r.out, "v\n\nabc\n \n-inf\n-1e308\n5\n7\n");
  r = RunTool({Concat(Base(), {"-k", "v:n:desc", dir / "in.csv"})});
  EXPECT_EQ(r.out, "v\n7\n5\n-1e308\n\nabc\n \n-inf\n");
}

TEST_F(SortCli, StringKeysPadSoShorterSortsFirstAndTooWideFails) {
  WriteFile(dir / "in.csv", "s\nabc\nab\n\"a\"\"\"\nabd\na\n");
  ToolResult r = RunTool({Concat(Base(), {"-k", "s:s3", dir / "in.csv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(r.out, "s\na\n\"a\"\"\"\nab\nabc\nabd\n");
  r = RunTool({Concat(Base(), {"-k", "s:s2", dir / "in.csv", "-o", dir / "out.csv"})});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_NE(r.err.find("line 2, column 1 (s)"), std::string::npos) << r.err;
  EXPECT_NE(r.err.find("wider than the key's width of 2"), std::string::npos) << r.err;
  EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
  ExpectNothingLeft({"in.csv"});
}

TEST_F(SortCli, BinaryRecordsAreSortedBitForBit) {
  const std::uint64_t seed = Seed();
  std::mt19937_64 rng(seed);
  const unsigned nvars = 5;
  std::string records;
  const std::uint64_t awkward[] = {0x7FF0000000000001ull /* signaling NaN */, 0x8000000000000000ull /* -0.0 */,
                                   0xFFEFFFFFFFFFFFFFull /* -DBL_MAX */, 0x2020202020202020ull /* blanks */};
  for (int i = 0; i < 3000; ++i) {
    std::uint64_t v[nvars];
    v[0] = awkward[rng() % 4];                       // never a key
    const double key = static_cast<double>(static_cast<int>(rng() % 50) - 25);
    std::memcpy(&v[1], &key, 8);                     // numeric key; -0.0 ties with 0.0
    if (rng() % 10 == 0) v[1] = 0x8000000000000000ull;
    char text[16];
    for (char& ch : text) ch = static_cast<char>("AB\0\xff"[rng() % 4]);
    std::memcpy(&v[2], text, 16);                    // a 12-byte string key over values 3-4
    v[4] = awkward[rng() % 4] ^ (rng() % 2);
    records.append(reinterpret_cast<const char*>(v), sizeof v);
  }
  WriteFile(dir / "in.bin", records);
  const ToolResult r = RunTool({Concat(Base(), {"--nvars", "5", "-k", "3:s12:desc", "-k", "2:n", dir / "in.bin",
                                                "-o", dir / "out.bin"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  const std::string out = ReadFile(dir / "out.bin");
  EXPECT_TRUE(out == OracleSortBinary(records, nvars, {{2, 12, -1}, {1, 0, 1}})) << "seed " << seed;
  // From standard input too, and a truncated record is an error.
  WriteFile(dir / "cut.bin", records.substr(0, records.size() - 3));
  const ToolResult cut = RunTool({Concat(Base(), {"--nvars", "5", "-k", "2:n"}), dir / "cut.bin"});
  EXPECT_EQ(cut.exitCode, 1);
  EXPECT_NE(cut.err.find("not a whole number of 40-byte records"), std::string::npos) << cut.err;
  EXPECT_EQ(cut.out, "");
}

// --- failures --------------------------------------------------------------

TEST_F(SortCli, BadUsageAndBadInputGiveOneLineAndNoOutput) {
  struct Bad {
    std::vector<std::string> args;
    std::string input;
    int exitCode;
    std::string message;
  };
  const std::string nowhere = dir / "missing-dir";
  const std::vector<Bad> cases = {
      {{"-k", "nope"}, "a,b\n1,2\n", 2, "unknown column 'nope'"},
      {{"-k", "3"}, "a,b\n1,2\n", 2, "the header has 2 columns"},
      {{"-k", "a:x"}, "a,b\n1,2\n", 2, "unknown column 'a:x'"},
      {{"-k", "a:s0"}, "a,b\n1,2\n", 2, "a string width must be from 1"},
      {{"-k", "x", "--no-header"}, "1,2\n", 2, "without a header, columns are numbers"},
      {{}, "a\n", 2, "no sort key"},
      {{"-k", "a", "--bogus"}, "a\n", 2, "unknown option '--bogus'"},
      {{"-k", "a", "-m", "lots"}, "a\n", 2, "bad size 'lots'"},
      {{"-k", "a"}, "a,b\n1,2\n3,\"x\n4,5\n", 1, "line 3: unterminated quote"},
      {{"-k", "b:s1"}, "a,b\n1,2\n3,45\n", 1, "line 3, column 2 (b)"},
      {{"-k", "a", "-T", nowhere}, "a\n1\n", 1, "cannot create the temporary file in " + nowhere},
  };
  for (const Bad& bad : cases) {
    SCOPED_TRACE(bad.message);
    WriteFile(dir / "in.csv", bad.input);
    std::vector<std::string> args = Concat(Base(), bad.args);
    args.insert(args.end(), {dir / "in.csv", "-o", dir / "out.csv"});
    const ToolResult r = RunTool({args});
    EXPECT_EQ(r.exitCode, bad.exitCode) << r.err;
    EXPECT_NE(r.err.find(bad.message), std::string::npos) << r.err;
    EXPECT_EQ(r.err.rfind("isort: ", 0), 0u) << r.err;
    EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
    ExpectNothingLeft({"in.csv"});
  }
}

TEST_F(SortCli, UnwritableOutputDirectoryFailsBeforeSorting) {
  ::mkdir((dir / "ro").c_str(), 0500);
  WriteFile(dir / "in.csv", "a\n2\n1\n");
  const ToolResult r = RunTool({Concat(Base(), {"-k", "a", dir / "in.csv", "-o", dir / "ro/out.csv"})});
  if (::geteuid() == 0) {
    // root writes anyway; the run must still succeed cleanly.
    EXPECT_EQ(r.exitCode, 0) << r.err;
  } else {
    EXPECT_EQ(r.exitCode, 1);
    EXPECT_NE(r.err.find("cannot create output " + dir / "ro/out.csv"), std::string::npos) << r.err;
  }
  const ToolResult none = RunTool({Concat(Base(), {"-k", "a", dir / "in.csv", "-o", dir / "no/such/out.csv"})});
  EXPECT_EQ(none.exitCode, 1);
  EXPECT_NE(none.err.find("No such file or directory"), std::string::npos) << none.err;
}

TEST_F(SortCli, FullTemporaryDirectoryIsReportedAndCleanedUp) {
  // Every row is longer than the forced capacity and goes to the side
  // store; past 16 MiB (at the default memory target) that is a file in the
  // temporary directory, and the file size limit makes its writes fail.
  std::string text = "a,b\n";
  for (int i = 0; i < 700000; ++i) text += std::to_string(i % 97) + ",some text that makes the row long\n";
  WriteFile(dir / "in.csv", text);
  ToolRun run{Concat(Base(), {"-k", "a:n", "--row-capacity", "8", dir / "in.csv", "-o", dir / "out.csv"})};
  run.fileSizeLimit = 256 * 1024;
  const ToolResult r = RunTool(run);
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_NE(r.err.find("cannot write the file for long rows in " + tmp.Path() + ": File too large"),
            std::string::npos)
      << r.err;
  ExpectNothingLeft({"in.csv"});
}

TEST_F(SortCli, ReplacingAnOutputIsAtomicAndKeepsItsMode) {
  WriteFile(dir / "in.csv", "a\n2\n1\n");
  WriteFile(dir / "out.csv", "old\n");
  ::chmod((dir / "out.csv").c_str(), 0640);
  // A failed run leaves the old file as it was.
  ToolResult r = RunTool({Concat(Base(), {"-k", "a:s", "--tsv", "-k", "zz", dir / "in.csv", "-o", dir / "out.csv"})});
  EXPECT_EQ(r.exitCode, 2);
  EXPECT_EQ(ReadFile(dir / "out.csv"), "old\n");
  r = RunTool({Concat(Base(), {"-k", "a", dir / "in.csv", "-o", dir / "out.csv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(ReadFile(dir / "out.csv"), "a\n1\n2\n");
  struct stat st;
  ASSERT_EQ(::stat((dir / "out.csv").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0640u);
  // Sorting a file onto itself works: the input is read before the output appears.
  r = RunTool({Concat(Base(), {"-k", "a:n:desc", dir / "out.csv", "-o", dir / "out.csv"})});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_EQ(ReadFile(dir / "out.csv"), "a\n2\n1\n");
  ExpectNothingLeft({"in.csv", "out.csv"});
}

TEST_F(SortCli, AKilledRunLeavesNothingBehind) {
  for (int sig : {SIGTERM, SIGINT, SIGKILL}) {
    SCOPED_TRACE(sig);
    WriteFile(dir / "out.csv", "old\n");
    int fds[2];
    ASSERT_EQ(::pipe(fds), 0);
    const pid_t pid = ::fork();
    if (pid == 0) {
      ::dup2(fds[0], 0);
      ::close(fds[0]);
      ::close(fds[1]);
      const int null = ::open("/dev/null", O_WRONLY);
      ::dup2(null, 2);
      // An inherited "ignore" would keep the signal from ending the tool.
      ::signal(SIGINT, SIG_DFL);
      ::signal(SIGTERM, SIG_DFL);
      std::vector<std::string> args = {ISORT_TOOL_PATH, "sort", "--quiet", "-T", tmp.Path(), "-k", "a:n", "-o",
                                       dir / "out.csv"};
      std::vector<char*> argv;
      for (std::string& a : args) argv.push_back(&a[0]);
      argv.push_back(nullptr);
      ::execv(ISORT_TOOL_PATH, argv.data());
      ::_exit(127);
    }
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

// --- gen --------------------------------------------------------------------

TEST(GenCli, SameSeedSameTableAndTheTableParses) {
  TempDir dir;
  ASSERT_EQ(RunTool({{"gen", "--rows", "3000", "--seed", "9", "-o", dir / "a.csv"}}).exitCode, 0);
  ASSERT_EQ(RunTool({{"gen", "--rows", "3000", "--seed", "9", "-o", dir / "b.csv"}}).exitCode, 0);
  ASSERT_EQ(RunTool({{"gen", "--rows", "3000", "--seed", "10", "-o", dir / "c.csv"}}).exitCode, 0);
  const std::string a = ReadFile(dir / "a.csv");
  EXPECT_EQ(a, ReadFile(dir / "b.csv"));
  EXPECT_NE(a, ReadFile(dir / "c.csv"));
  const std::vector<OracleRow> rows = OracleParse(a, ',', true);
  ASSERT_EQ(rows.size(), 3001u);
  bool quoted = false, missing = false;
  for (std::size_t i = 1; i < rows.size(); ++i) {
    ASSERT_EQ(rows[i].fields.size(), 9u) << rows[i].raw;
    const int age = std::stoi(rows[i].fields[3]);
    EXPECT_TRUE(age >= 18 && age <= 90);
    quoted = quoted || rows[i].raw.find('"') != std::string::npos;
    missing = missing || rows[i].fields[5].empty();
  }
  EXPECT_TRUE(quoted);
  EXPECT_TRUE(missing);
  ASSERT_EQ(RunTool({{"gen", "--binary", "--nvars", "6", "--rows", "100", "-o", dir / "d.bin"}}).exitCode, 0);
  EXPECT_EQ(ReadFile(dir / "d.bin").size(), 100u * 6 * 8);
}

}  // namespace
}  // namespace clitest
