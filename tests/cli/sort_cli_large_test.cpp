// End-to-end runs on inputs larger than the memory target, so the sort
// writes runs to temporary files and merges them. Slow tier.
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "cli_harness.h"

namespace clitest {
namespace {

class LargeSort : public ::testing::Test {
 protected:
  TempDir dir;
  TempDir tmp;
  void Generate(const char* seed) {
    ASSERT_EQ(RunTool({"gen", "--rows", "1500000", "--seed", seed, "-o", dir / "in.csv"}).exitCode, 0);
  }
};

TEST_F(LargeSort, ExternalCsvSortMatchesTheOracle) {
  Generate("11");
  std::vector<std::string> args = {"sort", "--quiet", "-T", tmp.Path(), "-k", "region", "-k", "income:n:desc",
                                   "-k", "4:n"};
  std::vector<std::string> toFile = args;
  toFile.insert(toFile.end(), {"--stats", dir / "in.csv", "-o", dir / "out.csv"});
  ToolResult r = RunTool(toFile);
  ASSERT_EQ(r.exitCode, 0) << r.err;
  // The statistics show runs merged from temporary files.
  EXPECT_NE(r.err.find("merge passes       1"), std::string::npos) << r.err;
  EXPECT_EQ(r.err.find("temporary bytes    0 B"), std::string::npos) << r.err;
  const std::string out = ReadFile(dir / "out.csv");
  const std::vector<OracleKey> keys = {{1, false, 1}, {5, true, -1}, {3, true, 1}};
  EXPECT_TRUE(out == OracleSort(ReadFile(dir / "in.csv"), true, ',', true, keys));
  // The same from standard input (copied to the temporary directory first)
  // to standard output, parsed on a thread of its own.
  args.push_back("--parse-thread");
  r = RunTool(args, dir / "in.csv");
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_TRUE(r.out == out);
  EXPECT_EQ(ListDir(tmp.Path()), std::vector<std::string>());
}

TEST_F(LargeSort, ExternalBinarySortMatchesTheOracle) {
  ASSERT_EQ(RunTool({"gen", "--binary", "--nvars", "8", "--rows", "1600000", "--seed", "3", "-o", dir / "in.bin"})
                .exitCode,
            0);
  const ToolResult r = RunTool({"sort", "--quiet", "-T", tmp.Path(), "--nvars", "8", "-k", "2:s8", "-k", "3:n:desc",
                                "-k", "4:n", dir / "in.bin", "-o", dir / "out.bin"});
  ASSERT_EQ(r.exitCode, 0) << r.err;
  EXPECT_TRUE(ReadFile(dir / "out.bin") ==
              OracleSortBinary(ReadFile(dir / "in.bin"), 8, {{1, 8, 1}, {2, 0, -1}, {3, 0, 1}}));
}

TEST_F(LargeSort, FullTemporaryDirectoryFailsCleanly) {
  Generate("2");
  WriteFile(dir / "out.csv", "old\n");
  // The runs need more than 40 MB of temporary files; the file size limit
  // makes the sort's writes fail as on a full disk.
  const ToolResult r = RunTool({"sort", "--quiet", "-T", tmp.Path(), "-k", "region", "-k", "income:n", dir / "in.csv",
                                "-o", dir / "out.csv"},
                               "", 40u << 20);
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_NE(r.err.find("File too large"), std::string::npos) << r.err;
  EXPECT_NE(r.err.find(tmp.Path()), std::string::npos) << r.err;
  EXPECT_EQ(std::count(r.err.begin(), r.err.end(), '\n'), 1) << r.err;
  EXPECT_EQ(ReadFile(dir / "out.csv"), "old\n");
  EXPECT_EQ(ListDir(tmp.Path()), std::vector<std::string>());
  EXPECT_EQ(ListDir(dir.Path()), (std::vector<std::string>{"in.csv", "out.csv"}));
}

TEST_F(LargeSort, KilledWhileSortingLeavesNothingBehind) {
  Generate("4");
  for (int sig : {SIGKILL, SIGTERM}) {
    SCOPED_TRACE(sig);
    int fds[2];
    ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
    const pid_t pid = StartTool({"sort", "--progress", "-T", tmp.Path(), "-k", "region", "-k", "income:n",
                                 dir / "in.csv", "-o", dir / "out.csv"},
                                -1, -1, fds[1]);
    ::close(fds[1]);
    // The progress display names the phase: once it has said "reading"
    // twice (a quarter of a second apart at least), the first pass is over
    // and the sort's workers have been running for a while.
    std::string seen;
    char buffer[4096];
    ssize_t n;
    while (seen.find("reading") == seen.rfind("reading") && (n = ::read(fds[0], buffer, sizeof buffer)) > 0) {
      seen.append(buffer, static_cast<std::size_t>(n));
    }
    ::kill(pid, sig);
    int status = 0;
    ::waitpid(pid, &status, 0);
    ::close(fds[0]);
    EXPECT_NE(seen.find("reading"), std::string::npos) << seen;
    EXPECT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(ListDir(tmp.Path()), std::vector<std::string>());
    EXPECT_EQ(ListDir(dir.Path()), std::vector<std::string>{"in.csv"});
  }
}

}  // namespace
}  // namespace clitest
