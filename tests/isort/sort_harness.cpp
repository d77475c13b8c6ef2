#include "sort_harness.h"

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>

namespace fs = std::filesystem;

namespace testing_support {

void SortTest::SetUp() {
  // A fresh directory per test: the clock and a counter keep names apart
  // across processes and within one.
  static std::atomic<unsigned> counter{0};
  const auto stamp = std::chrono::steady_clock::now().time_since_epoch().count();
  fs::path dir = fs::temp_directory_path() /
                 ("isort-test-" + std::to_string(stamp) + "-" + std::to_string(counter++));
  ASSERT_TRUE(fs::create_directory(dir)) << dir;
  tempDir_ = dir.string();
  std::ofstream(dir / "keep-me") << "the test's own file";
  vexahost::SetTempDirectory(tempDir_);
  UseThreads(2);
}

std::vector<std::string> SortTest::Leftovers() const {
  std::vector<std::string> names;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(tempDir_, ec)) {
    const std::string name = entry.path().filename().string();
    if (name != "keep-me") names.push_back(name);
  }
  return names;
}

void SortTest::TearDown() {
  EXPECT_TRUE(Leftovers().empty()) << "temporary files left behind";
  EXPECT_TRUE(fs::exists(fs::path(tempDir_) / "keep-me")) << "the test's own file was removed";
  std::error_code ec;
  fs::remove_all(tempDir_, ec);
  vexahost::SetTempDirectory("");
  vexahost::SetStreamBufferSize(0);
  vexahost::SetThreadSetting(0);
  vexahost::SetProcessorCounts(0, 0);
}

void SortTest::UseThreads(unsigned n) {
  vexahost::SetProcessorCounts(1, n);
  vexahost::SetThreadSetting(n);
}

}  // namespace testing_support
