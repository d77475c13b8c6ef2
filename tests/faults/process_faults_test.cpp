// The sort among processes and threads: a process killed in the middle of a
// spilling sort leaves no temporary file; sorts in two threads and in two
// processes share one temporary directory and both come out right; a
// temporary directory that is missing, not a directory, or not writable
// fails the sort with a clear ErrorText before any record is read.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <thread>

#include "fault_harness.h"
#include "host/hostsettings.h"
#include "sortfile_testing.h"

namespace faults {
namespace {

// Exit codes of a child that sorted.
constexpr int kChildSorted = 0;
constexpr int kChildWrong = 4;

void WriteByte(int fd) {
  const char byte = 1;
  while (write(fd, &byte, 1) < 0 && errno == EINTR) {
  }
}

bool ReadByte(int fd) {
  char byte;
  ssize_t n;
  do n = read(fd, &byte, 1);
  while (n < 0 && errno == EINTR);
  return n == 1;
}

// The status of a child that has ended.
int Wait(pid_t child) {
  int status = 0;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  return status;
}

class ProcessFaults : public FaultTest {};

// Ten moments of a sort that spills into hundreds of runs: in the input
// phase, at the end of the input (while the last runs are written and the
// merge passes begin) and in the final pass. Half the children are held at
// their call when the signal comes, half are left running (and are killed
// wherever they have got to, which varies; what must hold does not).
TEST_F(ProcessFaults, KilledSortLeavesNoTemporaryFile) {
  std::mt19937_64 rng(sortfile_testing::TestSeed(2027));
  const Records r = MakeRecords(20000, 4, 23);
  int killedMidSort = 0;
  for (int moment = 0; moment < 10; ++moment) {
    // The first moment is the end of the input, the call that returns null.
    const bool inPut = moment != 0 && rng() % 2 != 0;
    const std::size_t call = moment == 0 ? r.count : rng() % r.count;
    const bool hold = moment % 2 == 0;
    SCOPED_TRACE(std::string(inPut ? "PutRecord" : "GetRecord") + " call " + std::to_string(call) +
                 (hold ? ", held" : ", running"));
    int ready[2];
    ASSERT_EQ(pipe(ready), 0);
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      close(ready[0]);
      UseThreads(3);
      CallLog log(r);
      (inPut ? log.beforePut : log.beforeGet) = [&](std::size_t k) {
        if (k != call) return;
        WriteByte(ready[1]);
        while (hold) pause();
      };
      _exit(SortWith(log, MakeItSpill) == Ending::Completed ? kChildSorted : kChildWrong);
    }
    close(ready[1]);
    const bool signalled = ReadByte(ready[0]);
    close(ready[0]);
    kill(child, SIGKILL);
    const int status = Wait(child);
    EXPECT_TRUE(signalled) << "the child never reached the moment";
    // A running child may have finished just before the signal.
    if (WIFSIGNALED(status)) {
      EXPECT_EQ(WTERMSIG(status), SIGKILL);
      ++killedMidSort;
    } else {
      EXPECT_TRUE(!hold && WIFEXITED(status) && WEXITSTATUS(status) == kChildSorted);
    }
    EXPECT_TRUE(Leftovers().empty()) << "temporary files outlived the killed process";
  }
  std::printf("%d of 10 children killed in the middle of the sort\n", killedMidSort);
  EXPECT_GE(killedMidSort, 5);
}

TEST_F(ProcessFaults, TwoSortsShareTheDirectory) {
  UseThreads(2);
  const Records records[] = {MakeRecords(3000, 4, 29), MakeRecords(2500, 5, 31)};
  auto sortOne = [&records](int i) {
    CallLog log(records[i]);
    return SortWith(log, MakeItSpill) == Ending::Completed && log.Complete();
  };
  // In two threads of this process.
  bool sorted[2] = {false, false};
  std::thread first([&] { sorted[0] = sortOne(0); });
  std::thread second([&] { sorted[1] = sortOne(1); });
  first.join();
  second.join();
  EXPECT_TRUE(sorted[0] && sorted[1]);

  // In two processes, started together so that their files are there at once.
  int go[2];
  ASSERT_EQ(pipe(go), 0);
  pid_t children[2];
  for (int i = 0; i < 2; ++i) {
    children[i] = fork();
    ASSERT_GE(children[i], 0);
    if (children[i] == 0) {
      close(go[1]);
      _exit(ReadByte(go[0]) && sortOne(i) ? kChildSorted : kChildWrong);
    }
  }
  close(go[0]);
  WriteByte(go[1]);
  WriteByte(go[1]);
  close(go[1]);
  for (pid_t child : children) {
    const int status = Wait(child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == kChildSorted) << "status " << status;
  }
}

// The error a sort gets when its temporary directory is `dir`: a creation
// failure naming the directory and `reason`, raised before any callback;
// SORTFILE returns 5 and reports it. Returns what was wrong, if anything
// (also usable in a child, which cannot use the test macros).
std::string CheckUnusableDirectory(const std::string& dir, int reason, std::size_t records) {
  const Records r = MakeRecords(records, 4, 41);
  vexahost::SetTempDirectory(dir);
  CallLog log(r), viaSortFile(r);
  std::string text;
  auto spillIfLarge = [records](HookedSort& sort) {
    if (records > 100) MakeItSpill(sort);
  };
  Ending ending = SortWith(log, spillIfLarge, &text);
  const std::string expected = "create of " + dir + "/sort";
  const std::string because = std::string(" failed: ") + std::strerror(reason);
  if (ending != Ending::Error || text.compare(0, expected.size(), expected) != 0 ||
      text.size() < because.size() ||
      text.compare(text.size() - because.size(), because.size(), because) != 0) {
    return std::string("ended with ") + Name(ending) + " \"" + text + "\"";
  }
  sortfile_testing::ReportCapture capture;
  const FortranInt code = CallSortFile(viaSortFile, SortFileKeys(r), &ending);
  const std::vector<std::string> reports = capture.Reports();
  if (code != 5 || reports.size() != 1 || reports[0].compare(0, expected.size(), expected) != 0) {
    return "SORTFILE returned " + std::to_string(code) + " with " + std::to_string(reports.size()) +
           " reports";
  }
  return log.gets + log.puts + viaSortFile.gets + viaSortFile.puts != 0 ? "a callback was called"
                                                                        : "";
}

// Every sort creates its work file before it reads the first record, so an
// unusable directory fails even a sort that would have fitted in memory, and
// no record is taken in that could be lost.
TEST_F(ProcessFaults, UnusableTemporaryDirectory) {
  // The host keeps the directory setting's storage at the longest name it
  // has held; let it hold these names before anything is counted.
  vexahost::SetTempDirectory(tempDir_ + "/missing");
  atStart_ = Now();
  for (std::size_t records : {std::size_t{50}, std::size_t{3000}}) {
    for (const char* name : {"/missing", "/keep-me"}) {
      const Resources before = Now();
      EXPECT_EQ(CheckUnusableDirectory(tempDir_ + name, name[1] == 'm' ? ENOENT : ENOTDIR, records),
                "")
          << name;
      ExpectReleased(before, name, records);
    }
  }

  // A directory the process may not write to. Root writes anywhere, so a
  // child gives up its privileges first.
  const std::string dir = tempDir_ + "/read-only";
  ASSERT_EQ(mkdir(dir.c_str(), 0555), 0);
  ASSERT_EQ(chmod(dir.c_str(), 0555), 0);
  ASSERT_EQ(chmod(tempDir_.c_str(), 0755), 0);
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0)) _exit(10);
    const std::string problem = CheckUnusableDirectory(dir, EACCES, 3000);
    if (!problem.empty()) std::fprintf(stderr, "unwritable directory: %s\n", problem.c_str());
    _exit(problem.empty() ? kChildSorted : kChildWrong);
  }
  const int status = Wait(child);
  chmod(tempDir_.c_str(), 0700);
  rmdir(dir.c_str());
  ASSERT_TRUE(WIFEXITED(status)) << "status " << status;
  if (WEXITSTATUS(status) == 10) GTEST_SKIP() << "cannot give up root here";
  EXPECT_EQ(WEXITSTATUS(status), kChildSorted);
}

}  // namespace
}  // namespace faults
