// File and memory streams: buffering against a model file, copies that share
// one file, removal of temporary files, and how system failures surface
// (through the fault plan and, where possible, a really full file system).
#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "host/faultplan.h"
#include "host/hostsettings.h"
#include "isort/host/errhub.h"
#include "isort/host/iostore.h"

#ifdef _WIN32
#include <process.h>
#else
#include <signal.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>
#endif

namespace fs = std::filesystem;

namespace {

using Bytes = std::vector<unsigned char>;
constexpr auto kBegin = VEXA_StrBaseIO::SeekBegin;

Bytes RandomBytes(std::mt19937& rng, std::size_t n) {
  Bytes b(n);
  for (unsigned char& c : b) c = static_cast<unsigned char>(rng());
  return b;
}

// The message of a failed file operation: the operation, the file, and the
// reason; a system error's text is checked in full where strerror gives it.
void ExpectFileError(const std::string& message, const std::string& operation, const std::string& file,
                     int error, const char* reason = nullptr) {
  const std::string prefix = operation + " of " + file + " failed: ";
  EXPECT_EQ(prefix, message.substr(0, prefix.size())) << message;
  EXPECT_GT(message.size(), prefix.size()) << message;
  if (reason) {
    EXPECT_EQ(prefix + reason, message);
  }
#ifndef _WIN32
  if (!reason) {
    EXPECT_EQ(prefix + std::strerror(error), message);
  }
#else
  (void)error;
#endif
}

unsigned long ProcessId() {
#ifdef _WIN32
  return static_cast<unsigned long>(_getpid());
#else
  return static_cast<unsigned long>(getpid());
#endif
}

// A private temporary directory, made the host's for the test's duration.
class TempFiles : public ::testing::Test {
 protected:
  void SetUp() override {
    // Tests run in parallel processes; the process id and a random number
    // keep their directories apart (a fixed name once let one test remove
    // another's directory under wine).
    std::random_device entropy;
    do {
      dir_ = fs::temp_directory_path() /
             ("vexahost-test-" + std::to_string(ProcessId()) + "-" + std::to_string(entropy()));
    } while (!fs::create_directories(dir_));
    vexahost::SetTempDirectory(dir_.string());
  }
  void TearDown() override {
    vexahost::DisarmFaultPlan();
    vexahost::SetTempDirectory("");
    vexahost::SetStreamBufferSize(0);
    std::error_code ignored;
    fs::remove_all(dir_, ignored);
  }
  bool Empty() const { return fs::is_empty(dir_); }
  fs::path dir_;
};

// Random writes through `writer` at random places and reads through any of
// `readers` (the writer among them), transfers smaller and larger than the
// buffer, against a model of the bytes. A copy reads after a Seek, which
// lets it see everything written so far; the writer also reads on from
// where it stands.
void AgreeWithModel(VEXA_StrBaseIO& writer, const std::vector<VEXA_StrBaseIO*>& readers, std::mt19937& rng) {
  Bytes model;
  for (int step = 0; step < 3000; ++step) {
    const std::size_t limit = rng() % 8 ? 700 : 20000;
    if (rng() % 2) {
      const std::size_t at = rng() % (model.size() + 1);
      const Bytes data = RandomBytes(rng, rng() % limit);
      ASSERT_EQ(0, writer.Seek(static_cast<std::int64_t>(at), kBegin));
      ASSERT_EQ(data.size(), writer.Write(data.data(), static_cast<unsigned int>(data.size())));
      ASSERT_EQ(static_cast<std::int64_t>(at + data.size()), writer.Tell());
      if (model.size() < at + data.size()) model.resize(at + data.size());
      std::copy(data.begin(), data.end(), model.begin() + static_cast<std::ptrdiff_t>(at));
    } else {
      VEXA_StrBaseIO& reader = *readers[rng() % readers.size()];
      if (&reader != &writer || rng() % 2) {
        ASSERT_EQ(0, reader.Seek(static_cast<std::int64_t>(rng() % (model.size() + 1)), kBegin));
      }
      const std::size_t at = static_cast<std::size_t>(reader.Tell()), n = 1 + rng() % limit;
      ASSERT_LE(at, model.size());
      const std::size_t expect = std::min(n, model.size() - at);
      Bytes got(n);
      ASSERT_EQ(expect, reader.Read(got.data(), static_cast<unsigned int>(n))) << step;
      ASSERT_TRUE(std::equal(got.begin(), got.begin() + static_cast<std::ptrdiff_t>(expect),
                             model.begin() + static_cast<std::ptrdiff_t>(at)))
          << "step " << step;
      ASSERT_EQ(static_cast<std::int64_t>(at + expect), reader.Tell());
      ASSERT_EQ(expect < n, reader.EndOfFile() != 0);
      ASSERT_TRUE(reader.Good());
    }
  }
}

TEST_F(TempFiles, StreamsAgreeWithAModelFile) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 rng(seed);
  for (unsigned size : {1u, 13u, 300u, 4096u, 0u}) {
    SCOPED_TRACE("buffer " + std::to_string(size));
    vexahost::SetStreamBufferSize(size);
    VEXA_TempFile writer("sort", true);
    EXPECT_EQ(vexahost::StreamBufferSize(), writer.Footprint());
    VEXA_TempFile first(writer), second(writer);
    AgreeWithModel(writer, {&writer, &first, &second}, rng);
  }
  VEXA_InMemoryFile memory(0);
  AgreeWithModel(memory, {&memory}, rng);
}

TEST_F(TempFiles, SeekDirectionsAndNegativeTargets) {
  vexahost::SetStreamBufferSize(16);
  VEXA_TempFile file("sort", true);
  VEXA_InMemoryFile memory(0);
  for (VEXA_StrBaseIO* stream : std::vector<VEXA_StrBaseIO*>{&file, &memory}) {
    stream->Write("0123456789abcdefghijklmnopqrstuvwxyz", 36);
    EXPECT_NE(0, stream->Seek(-1, kBegin));
    EXPECT_NE(0, stream->Seek(-37, VEXA_StrBaseIO::SeekEnd));
    EXPECT_EQ(36, stream->Tell());
    ASSERT_EQ(0, stream->Seek(-6, VEXA_StrBaseIO::SeekEnd));
    char got[4] = {};
    ASSERT_EQ(3u, stream->Read(got, 3));
    EXPECT_STREQ("uvw", got);
    ASSERT_EQ(0, stream->Seek(-13, VEXA_StrBaseIO::SeekCurrent));
    ASSERT_EQ(3u, stream->Read(got, 3));
    EXPECT_STREQ("klm", got);
    EXPECT_NE(0, stream->Seek(-100, VEXA_StrBaseIO::SeekCurrent));
    EXPECT_EQ(23, stream->Tell());
    // Overwrite in the middle, then read across the seam.
    ASSERT_EQ(0, stream->Seek(2, kBegin));
    stream->Write("XY", 2);
    ASSERT_EQ(0, stream->Seek(1, kBegin));
    ASSERT_EQ(3u, stream->Read(got, 3));
    EXPECT_STREQ("1XY", got);
  }
  EXPECT_EQ(36, memory.Size());
  EXPECT_NE(0, memory.Seek(37, kBegin));  // a memory stream has no holes
}

TEST_F(TempFiles, CopiesReadAlternatelyAtTheirOwnPositions) {
  vexahost::SetStreamBufferSize(64);
  std::mt19937 rng(7);
  const Bytes data = RandomBytes(rng, 10000);
  VEXA_TempFile original("sort", true);
  original.Write(data.data(), static_cast<unsigned int>(data.size()));
  VEXA_TempFile first(original), second(original);
  ASSERT_EQ(0, first.Seek(0, kBegin));
  ASSERT_EQ(0, second.Seek(5000, kBegin));
  Bytes a, b;
  unsigned char chunk[37];
  while (a.size() < 5000) {
    unsigned n = first.Read(chunk, sizeof chunk);
    a.insert(a.end(), chunk, chunk + n);
    n = second.Read(chunk, sizeof chunk);
    b.insert(b.end(), chunk, chunk + n);
  }
  EXPECT_TRUE(std::equal(data.begin(), data.begin() + 5000, a.begin()));
  EXPECT_TRUE(std::equal(data.begin() + 5000, data.end(), b.begin()));
  EXPECT_TRUE(second.EndOfFile());
}

TEST_F(TempFiles, CopySeesUnflushedWrites) {
  vexahost::SetStreamBufferSize(1 << 16);
  VEXA_TempFile original("sort", true);
  original.Write("hello ", 6);
  VEXA_TempFile copy(original);
  EXPECT_EQ(6, copy.Tell());  // a copy starts where its original stands
  ASSERT_EQ(0, copy.Seek(0, kBegin));
  char got[16] = {};
  ASSERT_EQ(6u, copy.Read(got, 6));
  EXPECT_STREQ("hello ", got);
  // More bytes after the copy has filled its buffer.
  original.Write("world", 5);
  ASSERT_EQ(5u, copy.Read(got, 5));
  EXPECT_EQ(0, std::memcmp(got, "world", 5));
  // An overwrite inside the copy's buffered range shows after a Seek.
  ASSERT_EQ(0, original.Seek(0, kBegin));
  original.Write("HELLO", 5);
  ASSERT_EQ(0, copy.Seek(0, kBegin));
  ASSERT_EQ(11u, copy.Read(got, 11));
  EXPECT_EQ(0, std::memcmp(got, "HELLO world", 11));
  // And the other way round: a copy's writes reach the original.
  copy.Write("!", 1);
  ASSERT_EQ(0, original.Seek(0, VEXA_StrBaseIO::SeekEnd));
  EXPECT_EQ(12, original.Tell());
  ASSERT_EQ(0, original.Seek(11, kBegin));
  ASSERT_EQ(1u, original.Read(got, 2));
  EXPECT_EQ('!', got[0]);
}

// Once the writing is done, copies may read on threads of their own; the
// last bytes are left pending for a reader to flush.
TEST_F(TempFiles, CopiesReadOnSeveralThreads) {
  vexahost::SetStreamBufferSize(512);
  std::mt19937 rng(11);
  const Bytes data = RandomBytes(rng, 200000);
  VEXA_TempFile original("sort", true);
  original.Write(data.data(), static_cast<unsigned int>(data.size() - 100));
  original.Write(data.data() + data.size() - 100, 100);
  std::vector<std::unique_ptr<VEXA_TempFile>> copies;
  for (int i = 0; i < 4; ++i) copies.emplace_back(new VEXA_TempFile(original));
  std::atomic<int> mismatches{0};
  std::vector<std::thread> readers;
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([&, i] {
      for (int pass = 0; pass < 5; ++pass) {
        const std::size_t at = static_cast<std::size_t>(i * 37 + pass * 1001);
        copies[i]->Seek(static_cast<std::int64_t>(at), kBegin);
        Bytes got(data.size() - at);
        for (std::size_t done = 0; done < got.size(); done += 333)
          copies[i]->Read(got.data() + done, static_cast<unsigned int>(std::min<std::size_t>(333, got.size() - done)));
        if (!std::equal(got.begin(), got.end(), data.begin() + static_cast<std::ptrdiff_t>(at))) ++mismatches;
      }
    });
  }
  for (std::thread& t : readers) t.join();
  EXPECT_EQ(0, mismatches.load());
}

TEST_F(TempFiles, SharingAndRemoval) {
  {
    VEXA_TempFile original("merge", true);
    EXPECT_EQ(0u, std::string(original.Name()).find((dir_ / "merge").string())) << original.Name();
    EXPECT_FALSE(original.IsShared());
    original.Write("abc", 3);
    {
      VEXA_TempFile copy(original);
      EXPECT_TRUE(original.IsShared());
      EXPECT_TRUE(copy.IsShared());
    }
    EXPECT_FALSE(original.IsShared());
    std::unique_ptr<VEXA_TempFile> survivor(new VEXA_TempFile(original));
    original.Close();
    EXPECT_FALSE(survivor->IsShared());
    ASSERT_EQ(0, survivor->Seek(0, kBegin));
    char got[3];
    EXPECT_EQ(3u, survivor->Read(got, 3));
  }
  EXPECT_TRUE(Empty());

  // Without removeWhenDone the file stays, holding what was written.
  std::string kept;
  {
    VEXA_TempFile file("keep", false);
    kept = file.Name();
    file.Write("kept", 4);
  }
  EXPECT_EQ(4u, fs::file_size(kept));
}

#ifndef _WIN32
TEST_F(TempFiles, KilledProcessLeavesNothing) {
  int ready[2];
  ASSERT_EQ(0, pipe(ready));
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    std::vector<char> block(1 << 20, 'x');
    VEXA_TempFile a("sort", true), b("merge", true);
    a.Write(block.data(), static_cast<unsigned int>(block.size()));
    b.Write(block.data(), 100);
    VEXA_TempFile c(a);
    c.Write("y", 1);
    if (write(ready[1], "1", 1) != 1) _exit(2);
    for (;;) pause();
  }
  close(ready[1]);
  char byte = 0;
  ASSERT_EQ(1, read(ready[0], &byte, 1));
  close(ready[0]);
  kill(child, SIGKILL);
  int status = 0;
  ASSERT_EQ(child, waitpid(child, &status, 0));
  EXPECT_TRUE(WIFSIGNALED(status));
  EXPECT_TRUE(Empty());
}

// A real full file system: a 64 KiB tmpfs, where root may mount one.
TEST_F(TempFiles, FullFileSystemIsReported) {
  const fs::path mountPoint = dir_ / "tiny";
  fs::create_directory(mountPoint);
  if (geteuid() != 0 || mount("tmpfs", mountPoint.c_str(), "tmpfs", 0, "size=64k") != 0)
    GTEST_SKIP() << "cannot mount a tmpfs here";
  vexahost::SetTempDirectory(mountPoint.string());
  {
    VEXA_TempFile file("sort", true);
    const std::vector<char> block(1 << 20, 'x');
    std::string message;
    try {
      file.Write(block.data(), static_cast<unsigned int>(block.size()));
      file.Flush();
    } catch (const ErrorText& e) {
      message = e.Text();
    }
    EXPECT_FALSE(file.Good());
    ExpectFileError(message, "write", file.Name(), ENOSPC);
  }
  umount2(mountPoint.c_str(), MNT_DETACH);
}
#endif

// Planned failures, a full disk among them: a system error, and a transfer
// that stops making progress after its retry.
TEST_F(TempFiles, PlannedFailuresNameFileAndReason) {
  struct Case {
    vexahost::FileOp kind;
    unsigned long long nth;
    int error;
    bool shortTransfer;
    const char* reason;  // null: the system's text for `error`
    unsigned long long seen;
  } cases[] = {
      {vexahost::FileOp::Write, 2, vexahost::kErrorNoSpace, false, nullptr, 2},
      {vexahost::FileOp::Read, 1, vexahost::kErrorIo, false, nullptr, 1},
      {vexahost::FileOp::Write, 2, 0, true, "no bytes were written", 3},
      {vexahost::FileOp::Read, 1, 0, true, "the file ended early", 2},
  };
  for (const Case& c : cases) {
    const bool write = c.kind == vexahost::FileOp::Write;
    SCOPED_TRACE(std::string(write ? "write" : "read") + (c.shortTransfer ? ", short" : ""));
    vexahost::SetStreamBufferSize(64);
    VEXA_TempFile file("sort", true);
    const std::vector<char> block(1000, 'z');
    vexahost::FaultPlan plan;
    plan.kind = c.kind;
    plan.nth = c.nth;
    plan.error = c.error;
    plan.shortTransfer = c.shortTransfer;
    vexahost::ScopedFaultPlan armed(plan);
    file.Write(block.data(), 100);
    file.Flush();  // the first write goes through
    ASSERT_EQ(0, file.Seek(0, kBegin));
    std::string message;
    try {
      if (write) file.Write(block.data(), 1000);
      else file.Read(const_cast<char*>(block.data()), 100);
      ADD_FAILURE() << "no error";
    } catch (const ErrorText& e) {
      message = e.Text();
    }
    EXPECT_TRUE(vexahost::FaultInjected());
    EXPECT_EQ(c.seen, vexahost::FileOperationsSeen(c.kind));
    ExpectFileError(message, write ? "write" : "read", file.Name(), c.error, c.reason);
    EXPECT_FALSE(file.Good());
  }
}

TEST_F(TempFiles, CreationFailures) {
  {
    vexahost::FaultPlan plan;
    plan.kind = vexahost::FileOp::Create;
    plan.nth = 1;
    vexahost::ScopedFaultPlan armed(plan);
    try {
      VEXA_TempFile file("sort", true);
      ADD_FAILURE() << "no error";
    } catch (const ErrorText& e) {
      EXPECT_NE(std::string::npos, e.Text().find("create of " + (dir_ / "sort").string())) << e.Text();
    }
  }
  vexahost::SetTempDirectory((dir_ / "missing").string());
  try {
    VEXA_TempFile file("sort", true);
    ADD_FAILURE() << "no error";
  } catch (const ErrorText& e) {
    EXPECT_EQ(0u, e.Text().find("create of " + (dir_ / "missing" / "sort").string())) << e.Text();
#ifndef _WIN32
    EXPECT_NE(std::string::npos, e.Text().find(std::strerror(ENOENT))) << e.Text();
#endif
  }
  // A plain file where the directory should be: fails even for root.
  const fs::path notDir = dir_ / "plain";
  std::ofstream(notDir.string()) << "not a directory";
  vexahost::SetTempDirectory(notDir.string());
  EXPECT_THROW(VEXA_TempFile("sort", true), ErrorText);
}

TEST_F(TempFiles, NamedFileModes) {
  const std::string name = (dir_ / "named.dat").string();
  VEXA_FileStream stream;
  EXPECT_NE(0, stream.Open(name.c_str(), "rb"));
  EXPECT_FALSE(stream.Good());
  ASSERT_EQ(0, stream.Open(name.c_str(), "wb"));
  stream.Write("abcdef", 6);
  EXPECT_EQ(0, stream.Close());
  ASSERT_EQ(0, stream.Open(name.c_str(), "ab"));
  stream.Write("gh", 2);
  ASSERT_EQ(0, stream.Open(name.c_str(), "r+b"));
  ASSERT_EQ(0, stream.Seek(2, kBegin));
  stream.Write("CD", 2);
  ASSERT_EQ(0, stream.Open(name.c_str(), "rb"));
  char got[9] = {};
  EXPECT_EQ(8u, stream.Read(got, 9));
  EXPECT_STREQ("abCDefgh", got);
  EXPECT_THROW(stream.Write("x", 1), ErrorText);
}

}  // namespace
