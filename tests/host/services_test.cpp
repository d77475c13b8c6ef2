// The small host services: collation, value moves, the code table, the
// system-missing value, and reports to the sink.
#include <cfloat>
#include <cstdint>
#include <cstring>
#include <mutex>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "host/hostsettings.h"
#include "isort/host/errhub.h"
#include "isort/host/hostsys.h"
#include "isort/host/rtassert.h"
#include "isort/host/vexawcom.h"
#include "isort/host/vexawdat.h"
#include "isort/host/vexawlib.h"

namespace {

std::uint64_t Bits(double d) {
  std::uint64_t b;
  std::memcpy(&b, &d, 8);
  return b;
}

int Sign(int v) { return (v > 0) - (v < 0); }

// Reference order: bytes as unsigned, through an optional fold, then length.
int ReferenceCompare(const std::string& a, const std::string& b, bool fold) {
  auto weight = [fold](char c) {
    unsigned char u = static_cast<unsigned char>(c);
    return fold && u >= 'A' && u <= 'Z' ? u + 32 : u;
  };
  for (std::size_t i = 0; i < a.size() && i < b.size(); ++i)
    if (weight(a[i]) != weight(b[i])) return weight(a[i]) < weight(b[i]) ? -1 : 1;
  return a.size() < b.size() ? -1 : a.size() > b.size() ? 1 : 0;
}

int Compare(const VEXAMBCollator& c, const std::string& a, const std::string& b) {
  return c.Compare(a.data(), static_cast<unsigned int>(a.size()), b.data(),
                   static_cast<unsigned int>(b.size()));
}

// Unsigned bytes, then length; the result is the difference of the first
// differing bytes.
TEST(Collator, RandomStringsMatchReferenceAndCopies) {
  VEXAMBCollator plain;
  plain.Init();
  EXPECT_EQ(7, Compare(plain, "AH", "AA"));
  EXPECT_EQ(-7, Compare(plain, "AA", "AH"));
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 rng(seed);
  for (bool fold : {false, true}) {
    vexahost::SetCaseInsensitiveCollation(fold);
    VEXAMBCollator original;
    original.Init();
    vexahost::SetCaseInsensitiveCollation(!fold);  // copies keep the original's order
    const VEXAMBCollator copy(original);
    for (int i = 0; i < 20000; ++i) {
      // Long shared prefixes put the first difference anywhere in a word.
      std::string a(rng() % 40, 'x');
      for (char& ch : a) ch = static_cast<char>("aAbB\x7f\x80\xff "[rng() % 8]);
      std::string b = a.substr(0, rng() % (a.size() + 1));
      for (std::size_t extra = rng() % 5; extra; --extra) b += static_cast<char>("aAbB\x7f\x80\xff "[rng() % 8]);
      const int expected = ReferenceCompare(a, b, fold);
      ASSERT_EQ(expected, Sign(Compare(original, a, b))) << fold;
      ASSERT_EQ(expected, Sign(Compare(copy, a, b))) << fold;
      ASSERT_EQ(-expected, Sign(Compare(copy, b, a))) << fold;
    }
  }
  vexahost::SetCaseInsensitiveCollation(false);
}

// Signaling NaNs must not pass through a floating-point register.
TEST(Values, ObmoveCopiesBitPatterns) {
  const std::uint64_t patterns[] = {0x7FF0000000000001ull, 0x8000000000000000ull, 0x2020202020202020ull, 42};
  std::vector<OBS> from(1000), to(1001, 1.0);
  for (std::size_t i = 0; i < from.size(); ++i) std::memcpy(&from[i], &patterns[i % 4], 8);
  FortranInt n = 1000;
  OBMOVE(from.data(), to.data(), &n);
  EXPECT_EQ(0, std::memcmp(from.data(), to.data(), 8000));
  EXPECT_EQ(1.0, to[1000]);
}

TEST(Values, IeeePart1HoldsHighWordsOfSmallIntegers) {
  for (int code = 0; code < 256; ++code) {
    const std::uint32_t expected =
        code >= 1 && code <= 251 ? static_cast<std::uint32_t>(Bits(code - 100.0) >> 32) : 0;
    EXPECT_EQ(expected, IEEEPart1[code]) << code;
  }
}

TEST(Values, SystemMissingValueInTheGlobalBlock) {
  const unsigned char* global = static_cast<const unsigned char*>(pvGetCmnGlb());
  std::uint64_t missing;
  std::memcpy(&missing, global + kSystemMissingOffset, 8);
  EXPECT_EQ(Bits(-DBL_MAX), missing);
  EXPECT_EQ(static_cast<const void*>(global + 8), static_cast<const void*>(vexahost::SystemMissing()));
}

// Captures the host's reports for one test.
class Reports : public ::testing::Test {
 protected:
  void SetUp() override {
    vexahost::SetReportSink([this](const std::string& message) {
      std::lock_guard<std::mutex> lock(mutex_);
      messages_.push_back(message);
    });
  }
  void TearDown() override { vexahost::SetReportSink(nullptr); }
  std::vector<std::string> Messages() {
    std::lock_guard<std::mutex> lock(mutex_);
    return messages_;
  }
  std::mutex mutex_;
  std::vector<std::string> messages_;
};

std::string g_customText;
int g_customAttribute = -1;
void CustomReporter(const char* text, int attribute) {
  g_customText = text;
  g_customAttribute = attribute;
}

TEST_F(Reports, AssertsAndErrorsReachTheSink) {
  const char name[] = "SRTFVA  ";
  const char text[] = "key beyond record";
  FortranInt nameLength = 8, textLength = 17;
  ASSERT(&nameLength, name, nameLength, &textLength, text, textLength);
  VexaRuntimeAssert(L"nvars", L"sortfile.cpp", 42);
  VexaRuntimeAssert(L"caf\u00e9", L"f", 1);
  Reporter("plain report", 3);
  {
    VexaErrorMonitor monitor(Reporter);
    monitor.Report(ErrorText("write of x failed: disk", 2));
  }
  VexaErrorMonitor custom(CustomReporter);
  custom.Report(ErrorText("to the caller's function", 9));
  EXPECT_EQ("to the caller's function", g_customText);
  EXPECT_EQ(9, g_customAttribute);
  const std::vector<std::string> expected = {
      "ASSERT in SRTFVA: key beyond record", "Assertion failed: nvars, file sortfile.cpp, line 42",
      "Assertion failed: caf\xc3\xa9, file f, line 1", "plain report", "write of x failed: disk"};
  EXPECT_EQ(expected, Messages());
}

}  // namespace
