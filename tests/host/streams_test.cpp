// File and memory streams: buffering, copies that share one file, removal of
// temporary files, and how system failures surface (through the fault plan
// and, where possible, a really full file system).
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

#ifndef _WIN32
#include <signal.h>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>
#endif

namespace fs = std::filesystem;

namespace {

using Bytes = std::vector<unsigned char>;

Bytes RandomBytes(std::mt19937& rng, std::size_t n) {
  Bytes b(n);
  for (unsigned char& c : b) c = static_cast<unsigned char>(rng());
  return b;
}

// The message of a failed file operation: the operation, the file, and the
// system's text for the error (checked in full where strerror gives it).
void ExpectFileError(const std::string& message, const std::string& operation,
                     const std::string& file, int error) {
  const std::string prefix = operation + " of " + file + " failed: ";
  EXPECT_EQ(prefix, message.substr(0, prefix.size())) << message;
  EXPECT_GT(message.size(), prefix.size()) << message;
#ifndef _WIN32
  EXPECT_EQ(prefix + std::strerror(error), message);
#else
  (void)error;
#endif
}

// A private temporary directory, made the host's for the test's duration.
class TempDirTest : public ::testing::Test {
 protected:
  void SetUp() override {
    static std::atomic<int> counter{0};
    dir_ = fs::temp_directory_path() /
           ("vexahost-test-" + std::to_string(
#ifdef _WIN32
                                   0
#else
                                   getpid()
#endif
                                   ) +
            "-" + std::to_string(counter++));
    fs::remove_all(dir_);
    fs::create_directories(dir_);
    vexahost::SetTempDirectory(dir_.string());
  }
  void TearDown() override {
    vexahost::DisarmFaultPlan();
    vexahost::SetTempDirectory("");
    vexahost::SetStreamBufferSize(0);
    std::error_code ignored;
    fs::remove_all(dir_, ignored);
  }
  std::vector<std::string> Listing() const {
    std::vector<std::string> names;
    for (const auto& entry : fs::directory_iterator(dir_)) names.push_back(entry.path().filename().string());
    return names;
  }
  fs::path dir_;
};

using TempFiles = TempDirTest;

// Random writes and reads through one object at several buffer sizes, with
// transfers smaller and larger than the buffer.
TEST_F(TempFiles, SequentialRoundTrip) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 rng(seed);
  for (unsigned size : {1u, 13u, 4096u, 0u}) {
    vexahost::SetStreamBufferSize(size);
    VEXA_TempFile file("sort", true);
    EXPECT_EQ(vexahost::StreamBufferSize(), file.Footprint());
    const Bytes data = RandomBytes(rng, 300000);
    for (std::size_t done = 0; done < data.size();) {
      const std::size_t n = std::min<std::size_t>(data.size() - done, rng() % 3 ? rng() % 100 : rng() % 20000);
      ASSERT_EQ(n, file.Write(data.data() + done, static_cast<unsigned int>(n)));
      done += n;
      ASSERT_EQ(static_cast<std::int64_t>(done), file.Tell());
    }
    ASSERT_EQ(0, file.Seek(0, VEXA_StrBaseIO::SeekBegin));
    Bytes back(data.size());
    for (std::size_t done = 0; done < data.size();) {
      const std::size_t n = std::min<std::size_t>(data.size() - done, rng() % 3 ? rng() % 100 : rng() % 20000);
      ASSERT_EQ(n, file.Read(back.data() + done, static_cast<unsigned int>(n)));
      done += n;
    }
    ASSERT_TRUE(data == back);
    EXPECT_FALSE(file.EndOfFile());
    unsigned char extra[4];
    EXPECT_EQ(0u, file.Read(extra, 4));
    EXPECT_TRUE(file.EndOfFile());
    EXPECT_TRUE(file.Good());
    file.Clear();
    EXPECT_FALSE(file.EndOfFile());
  }
}

TEST_F(TempFiles, SeekDirectionsAndNegativeTargets) {
  vexahost::SetStreamBufferSize(16);
  VEXA_TempFile file("sort", true);
  const char text[] = "0123456789abcdefghijklmnopqrstuvwxyz";
  file.Write(text, 36);
  EXPECT_NE(0, file.Seek(-1, VEXA_StrBaseIO::SeekBegin));
  EXPECT_NE(0, file.Seek(-37, VEXA_StrBaseIO::SeekEnd));
  EXPECT_EQ(36, file.Tell());
  ASSERT_EQ(0, file.Seek(-6, VEXA_StrBaseIO::SeekEnd));
  char got[4] = {};
  ASSERT_EQ(3u, file.Read(got, 3));
  EXPECT_STREQ("uvw", got);
  ASSERT_EQ(0, file.Seek(-13, VEXA_StrBaseIO::SeekCurrent));
  ASSERT_EQ(3u, file.Read(got, 3));
  EXPECT_STREQ("klm", got);
  EXPECT_NE(0, file.Seek(-100, VEXA_StrBaseIO::SeekCurrent));
  EXPECT_EQ(23, file.Tell());
  // Overwrite in the middle, then read across the seam.
  ASSERT_EQ(0, file.Seek(2, VEXA_StrBaseIO::SeekBegin));
  file.Write("XY", 2);
  ASSERT_EQ(0, file.Seek(1, VEXA_StrBaseIO::SeekBegin));
  ASSERT_EQ(3u, file.Read(got, 3));
  EXPECT_STREQ("1XY", got);
}

TEST_F(TempFiles, CopiesReadAlternatelyAtTheirOwnPositions) {
  vexahost::SetStreamBufferSize(64);
  std::mt19937 rng(7);
  const Bytes data = RandomBytes(rng, 10000);
  VEXA_TempFile original("sort", true);
  original.Write(data.data(), static_cast<unsigned int>(data.size()));
  VEXA_TempFile first(original), second(original);
  ASSERT_EQ(0, first.Seek(0, VEXA_StrBaseIO::SeekBegin));
  ASSERT_EQ(0, second.Seek(5000, VEXA_StrBaseIO::SeekBegin));
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
  ASSERT_EQ(0, copy.Seek(0, VEXA_StrBaseIO::SeekBegin));
  char got[16] = {};
  ASSERT_EQ(6u, copy.Read(got, 6));
  EXPECT_STREQ("hello ", got);
  // More bytes after the copy has filled its buffer.
  original.Write("world", 5);
  ASSERT_EQ(5u, copy.Read(got, 5));
  EXPECT_EQ(0, std::memcmp(got, "world", 5));
  // An overwrite inside the copy's buffered range shows after a Seek.
  ASSERT_EQ(0, copy.Seek(0, VEXA_StrBaseIO::SeekBegin));
  ASSERT_EQ(11u, copy.Read(got, 11));  // the copy now holds [0, 11) in its buffer
  ASSERT_EQ(0, original.Seek(0, VEXA_StrBaseIO::SeekBegin));
  original.Write("HELLO", 5);
  ASSERT_EQ(0, copy.Seek(0, VEXA_StrBaseIO::SeekBegin));
  ASSERT_EQ(11u, copy.Read(got, 11));
  EXPECT_EQ(0, std::memcmp(got, "HELLO world", 11));
  // And the other way round: a copy's writes reach the original.
  ASSERT_EQ(0, copy.Seek(0, VEXA_StrBaseIO::SeekEnd));
  copy.Write("!", 1);
  ASSERT_EQ(0, original.Seek(11, VEXA_StrBaseIO::SeekBegin));
  ASSERT_EQ(1u, original.Read(got, 2));
  EXPECT_EQ('!', got[0]);
  EXPECT_EQ(0, original.Seek(0, VEXA_StrBaseIO::SeekEnd));
  EXPECT_EQ(12, original.Tell());
}

// One object writes at random places, copies read at random places; each
// read follows a Seek, after which a copy sees everything written so far.
TEST_F(TempFiles, CopiesAgreeWithAModelFile) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 rng(seed);
  for (unsigned size : {5u, 300u, 0u}) {
    vexahost::SetStreamBufferSize(size);
    VEXA_TempFile writer("sort", true);
    std::vector<std::unique_ptr<VEXA_TempFile>> readers;
    readers.emplace_back(new VEXA_TempFile(writer));
    readers.emplace_back(new VEXA_TempFile(writer));
    Bytes model;
    for (int step = 0; step < 3000; ++step) {
      if (rng() % 2) {
        const std::size_t at = model.empty() ? 0 : rng() % (model.size() + 1);
        const Bytes data = RandomBytes(rng, rng() % 4 ? rng() % 50 : rng() % 2000);
        ASSERT_EQ(0, writer.Seek(static_cast<std::int64_t>(at), VEXA_StrBaseIO::SeekBegin));
        writer.Write(data.data(), static_cast<unsigned int>(data.size()));
        if (model.size() < at + data.size()) model.resize(at + data.size());
        std::copy(data.begin(), data.end(), model.begin() + static_cast<std::ptrdiff_t>(at));
      } else {
        VEXA_TempFile& reader = *readers[rng() % readers.size()];
        const std::size_t at = model.empty() ? 0 : rng() % model.size();
        const std::size_t n = rng() % 700;
        ASSERT_EQ(0, reader.Seek(static_cast<std::int64_t>(at), VEXA_StrBaseIO::SeekBegin));
        Bytes got(n);
        const std::size_t expect = std::min(n, model.size() - at);
        ASSERT_EQ(expect, reader.Read(got.data(), static_cast<unsigned int>(n))) << step;
        ASSERT_TRUE(std::equal(got.begin(), got.begin() + static_cast<std::ptrdiff_t>(expect),
                               model.begin() + static_cast<std::ptrdiff_t>(at)))
            << "step " << step;
      }
    }
  }
}

// Once the writing is done, copies may read on threads of their own.
TEST_F(TempFiles, CopiesReadOnSeveralThreads) {
  vexahost::SetStreamBufferSize(512);
  std::mt19937 rng(11);
  const Bytes data = RandomBytes(rng, 200000);
  VEXA_TempFile original("sort", true);
  original.Write(data.data(), static_cast<unsigned int>(data.size() - 100));
  original.Write(data.data() + data.size() - 100, 100);  // left pending for a reader to flush
  std::vector<std::unique_ptr<VEXA_TempFile>> copies;
  for (int i = 0; i < 4; ++i) copies.emplace_back(new VEXA_TempFile(original));
  std::atomic<int> mismatches{0};
  std::vector<std::thread> readers;
  for (int i = 0; i < 4; ++i) {
    readers.emplace_back([&, i] {
      VEXA_TempFile& copy = *copies[i];
      for (int pass = 0; pass < 5; ++pass) {
        const std::size_t at = static_cast<std::size_t>(i * 37 + pass * 1001);
        copy.Seek(static_cast<std::int64_t>(at), VEXA_StrBaseIO::SeekBegin);
        Bytes got(data.size() - at);
        for (std::size_t done = 0; done < got.size(); done += 333)
          copy.Read(got.data() + done, static_cast<unsigned int>(std::min<std::size_t>(333, got.size() - done)));
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
    const std::string name = original.Name();
    EXPECT_EQ(0u, name.find((dir_ / "merge").string())) << name;
    EXPECT_FALSE(original.IsShared());
    original.Write("abc", 3);
    {
      VEXA_TempFile copy(original);
      EXPECT_TRUE(original.IsShared());
      EXPECT_TRUE(copy.IsShared());
    }
    EXPECT_FALSE(original.IsShared());
    auto* survivor = new VEXA_TempFile(original);
    original.Close();
    EXPECT_FALSE(survivor->IsShared());
    ASSERT_EQ(0, survivor->Seek(0, VEXA_StrBaseIO::SeekBegin));
    char got[3];
    EXPECT_EQ(3u, survivor->Read(got, 3));
    delete survivor;
  }
  EXPECT_TRUE(Listing().empty());

  // Without removeWhenDone the file stays, holding what was written.
  std::string kept;
  {
    VEXA_TempFile file("keep", false);
    kept = file.Name();
    file.Write("kept", 4);
  }
  ASSERT_TRUE(fs::exists(kept));
  EXPECT_EQ(4u, fs::file_size(kept));
  fs::remove(kept);
}

#ifndef _WIN32
TEST_F(TempFiles, RemovedFilesAreNeverListed) {
  VEXA_TempFile file("sort", true);
  file.Write("x", 1);
  file.Flush();
  EXPECT_TRUE(Listing().empty());
}

TEST_F(TempFiles, KilledProcessLeavesNothing) {
  int ready[2];
  ASSERT_EQ(0, pipe(ready));
  const pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    close(ready[0]);
    std::vector<char> block(1 << 20, 'x');
    VEXA_TempFile a("sort", true), b("merge", true);
    a.Write(block.data(), static_cast<unsigned int>(block.size()));
    b.Write(block.data(), 100);
    VEXA_TempFile c(a);
    c.Write("y", 1);
    char byte = 1;
    if (write(ready[1], &byte, 1) != 1) _exit(2);
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
  EXPECT_TRUE(Listing().empty());
}

// A real full file system: a 64 KiB tmpfs, where root may mount one.
TEST_F(TempFiles, FullFileSystemIsReported) {
  const fs::path mountPoint = dir_ / "tiny";
  fs::create_directory(mountPoint);
  if (geteuid() != 0 || mount("tmpfs", mountPoint.c_str(), "tmpfs", 0, "size=64k") != 0)
    GTEST_SKIP() << "cannot mount a tmpfs here";
  vexahost::SetTempDirectory(mountPoint.string());
  std::string message;
  {
    VEXA_TempFile file("sort", true);
    const std::vector<char> block(1 << 20, 'x');
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

TEST_F(TempFiles, PlannedWriteFailureNamesFileAndReason) {
  vexahost::SetStreamBufferSize(256);
  VEXA_TempFile file("sort", true);
  std::string message;
  {
    vexahost::FaultPlan plan;
    plan.kind = vexahost::FileOp::Write;
    plan.nth = 2;
    plan.error = vexahost::kErrorNoSpace;
    vexahost::ScopedFaultPlan armed(plan);
    const std::vector<char> block(1000, 'z');
    file.Write(block.data(), 100);
    file.Flush();  // the first write goes through
    try {
      file.Write(block.data(), 1000);
    } catch (const ErrorText& e) {
      message = e.Text();
    }
    EXPECT_TRUE(vexahost::FaultInjected());
    EXPECT_EQ(2u, vexahost::FileOperationsSeen(vexahost::FileOp::Write));
  }
  ExpectFileError(message, "write", file.Name(), vexahost::kErrorNoSpace);
#ifndef _WIN32
  EXPECT_EQ("write of " + std::string(file.Name()) + " failed: No space left on device", message);
#endif
  EXPECT_FALSE(file.Good());
}

TEST_F(TempFiles, PlannedReadFailure) {
  VEXA_TempFile file("sort", true);
  file.Write("0123456789", 10);
  ASSERT_EQ(0, file.Seek(0, VEXA_StrBaseIO::SeekBegin));
  vexahost::FaultPlan plan;
  plan.kind = vexahost::FileOp::Read;
  plan.nth = 1;
  plan.error = vexahost::kErrorIo;
  vexahost::ScopedFaultPlan armed(plan);
  char got[10];
  try {
    file.Read(got, 10);
    ADD_FAILURE() << "no error";
  } catch (const ErrorText& e) {
    ExpectFileError(e.Text(), "read", file.Name(), vexahost::kErrorIo);
  }
}

TEST_F(TempFiles, ShortTransfersAreRetriedThenReported) {
  vexahost::SetStreamBufferSize(64);
  VEXA_TempFile file("sort", true);
  {
    vexahost::FaultPlan plan;
    plan.kind = vexahost::FileOp::Write;
    plan.nth = 1;
    plan.shortTransfer = true;
    vexahost::ScopedFaultPlan armed(plan);
    const std::vector<char> block(1000, 'q');
    EXPECT_THROW(file.Write(block.data(), 1000), ErrorText);
    // The partial transfer was followed by a retry.
    EXPECT_EQ(2u, vexahost::FileOperationsSeen(vexahost::FileOp::Write));
  }
  VEXA_TempFile other("sort", true);
  other.Write("0123456789", 10);
  ASSERT_EQ(0, other.Seek(0, VEXA_StrBaseIO::SeekBegin));
  vexahost::FaultPlan plan;
  plan.kind = vexahost::FileOp::Read;
  plan.nth = 1;
  plan.shortTransfer = true;
  vexahost::ScopedFaultPlan armed(plan);
  char got[10];
  try {
    other.Read(got, 10);
    ADD_FAILURE() << "no error";
  } catch (const ErrorText& e) {
    EXPECT_EQ("read of " + std::string(other.Name()) + " failed: the file ended early", e.Text());
  }
}

TEST_F(TempFiles, CreationFailures) {
  {
    vexahost::FaultPlan plan;
    plan.kind = vexahost::FileOp::Create;
    plan.nth = 1;
    plan.error = vexahost::kErrorIo;
    vexahost::ScopedFaultPlan armed(plan);
    try {
      VEXA_TempFile file("sort", true);
      ADD_FAILURE() << "no error";
    } catch (const ErrorText& e) {
      EXPECT_NE(std::string::npos, e.Text().find("create of " + (dir_ / "sort").string()));
    }
  }
  vexahost::SetTempDirectory((dir_ / "missing").string());
  try {
    VEXA_TempFile file("sort", true);
    ADD_FAILURE() << "no error";
  } catch (const ErrorText& e) {
    EXPECT_EQ(0u, e.Text().find("create of " + (dir_ / "missing" / "sort").string()));
#ifndef _WIN32
    EXPECT_NE(std::string::npos, e.Text().find(std::strerror(ENOENT)));
#endif
  }
  // A plain file where the directory should be: fails even for root.
  const fs::path notDir = dir_ / "plain";
  std::ofstream(notDir.string()) << "not a directory";
  vexahost::SetTempDirectory(notDir.string());
  EXPECT_THROW(VEXA_TempFile("sort", true), ErrorText);
}

TEST_F(TempFiles, NamedFiles) {
  const std::string name = (dir_ / "named.dat").string();
  VEXA_FileStream stream;
  EXPECT_NE(0, stream.Open(name.c_str(), "rb"));
  EXPECT_FALSE(stream.Good());
  ASSERT_EQ(0, stream.Open(name.c_str(), "wb"));
  stream.Write("abcdef", 6);
  EXPECT_EQ(0, stream.Close());
  ASSERT_EQ(0, stream.Open(name.c_str(), "ab"));
  stream.Write("gh", 2);
  ASSERT_EQ(0, stream.Open(name.c_str(), "rb"));
  char got[9] = {};
  EXPECT_EQ(8u, stream.Read(got, 9));
  EXPECT_STREQ("abcdefgh", got);
  EXPECT_THROW(stream.Write("x", 1), ErrorText);
  ASSERT_EQ(0, stream.Open(name.c_str(), "r+b"));
  ASSERT_EQ(0, stream.Seek(2, VEXA_StrBaseIO::SeekBegin));
  stream.Write("CD", 2);
  ASSERT_EQ(0, stream.Seek(0, VEXA_StrBaseIO::SeekBegin));
  EXPECT_EQ(8u, stream.Read(got, 8));
  EXPECT_STREQ("abCDefgh", got);
}

TEST(InMemoryFile, ReadWriteSeekAndGrowth) {
  VEXA_InMemoryFile file(0);
  EXPECT_EQ(0u, file.Capacity());
  std::mt19937 rng(3);
  const Bytes data = RandomBytes(rng, 100000);
  for (std::size_t done = 0; done < data.size(); done += 1000)
    ASSERT_EQ(1000u, file.Write(data.data() + done, 1000));
  EXPECT_EQ(100000, file.Size());
  EXPECT_GE(file.Capacity(), 100000u);
  EXPECT_NE(0, file.Seek(100001, VEXA_StrBaseIO::SeekBegin));
  EXPECT_NE(0, file.Seek(-1, VEXA_StrBaseIO::SeekBegin));
  EXPECT_EQ(100000, file.Tell());
  ASSERT_EQ(0, file.Seek(-100000, VEXA_StrBaseIO::SeekEnd));
  Bytes back(data.size() + 10);
  EXPECT_EQ(100000u, file.Read(back.data(), static_cast<unsigned int>(back.size())));
  EXPECT_TRUE(file.EndOfFile());
  EXPECT_TRUE(std::equal(data.begin(), data.end(), back.begin()));
  ASSERT_EQ(0, file.Seek(10, VEXA_StrBaseIO::SeekBegin));
  EXPECT_FALSE(file.EndOfFile());
  file.Write("xyz", 3);
  EXPECT_EQ(100000, file.Size());
  ASSERT_EQ(0, file.Seek(-3, VEXA_StrBaseIO::SeekCurrent));
  char got[3];
  EXPECT_EQ(3u, file.Read(got, 3));
  EXPECT_EQ(0, std::memcmp(got, "xyz", 3));
}

}  // namespace
