#include "sort_harness.h"

#include <dirent.h>
#include <stdlib.h>
#include <unistd.h>

#include <fstream>

namespace testing_support {

void SortTest::SetUp() {
  char pattern[] = "/tmp/isort-test-XXXXXX";
  ASSERT_NE(mkdtemp(pattern), nullptr);
  tempDir_ = pattern;
  std::ofstream(tempDir_ + "/keep-me") << "the test's own file";
  vexahost::SetTempDirectory(tempDir_);
  UseThreads(2);
}

std::vector<std::string> SortTest::Leftovers() const {
  std::vector<std::string> names;
  if (DIR* dir = opendir(tempDir_.c_str())) {
    while (dirent* e = readdir(dir)) {
      const std::string name = e->d_name;
      if (name != "." && name != ".." && name != "keep-me") names.push_back(name);
    }
    closedir(dir);
  }
  return names;
}

void SortTest::TearDown() {
  EXPECT_TRUE(Leftovers().empty()) << "temporary files left behind";
  std::ifstream keep(tempDir_ + "/keep-me");
  EXPECT_TRUE(keep.good()) << "the test's own file was removed";
  for (const std::string& name : Leftovers()) unlink((tempDir_ + "/" + name).c_str());
  unlink((tempDir_ + "/keep-me").c_str());
  rmdir(tempDir_.c_str());
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
