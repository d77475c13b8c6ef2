// SORTFILE: return codes, reports, preconditions, key conversion, and that a
// failed sort leaves nothing behind.
#include <gtest/gtest.h>

#include <algorithm>
#include <new>
#include <string>
#include <vector>

#include "host/faultplan.h"
#include "isort/host/errhub.h"
#include "sortfile_testing.h"

namespace {

using namespace sortfile_testing;

// Records of `nvars` values: value 0 a key with many ties, value 1 the
// record's input position, the rest derived from it.
void FillRecords(SortContext& c, FortranInt nvars, std::size_t records, std::uint32_t seed) {
  std::mt19937 random(seed);
  c.nvars = nvars;
  c.input.resize(records * nvars);
  for (std::size_t r = 0; r < records; ++r) {
    OBS* record = &c.input[r * nvars];
    SetDouble(record, static_cast<double>(random() % 1000));
    if (nvars > 1) SetDouble(record + 1, static_cast<double>(r));
    for (FortranInt v = 2; v < nvars; ++v) SetDouble(record + v, static_cast<double>(r * 7 + v));
  }
}

// The input ordered by value 0 (ascending or descending), ties in input order.
std::vector<OBS> StableByFirstValue(const SortContext& c, bool ascending) {
  const std::size_t n = c.Records();
  std::vector<std::size_t> order(n);
  for (std::size_t i = 0; i < n; ++i) order[i] = i;
  std::stable_sort(order.begin(), order.end(), [&](std::size_t a, std::size_t b) {
    const double x = c.input[a * c.nvars], y = c.input[b * c.nvars];
    return ascending ? x < y : x > y;
  });
  std::vector<OBS> out;
  out.reserve(c.input.size());
  for (std::size_t i : order) {
    out.insert(out.end(), c.input.begin() + i * c.nvars, c.input.begin() + (i + 1) * c.nvars);
  }
  return out;
}

bool SameBits(const std::vector<OBS>& a, const std::vector<OBS>& b) {
  return a.size() == b.size() && std::memcmp(a.data(), b.data(), a.size() * sizeof(OBS)) == 0;
}

bool AnyContains(const std::vector<std::string>& reports, const std::string& text) {
  for (const std::string& r : reports) {
    if (r.find(text) != std::string::npos) return true;
  }
  return false;
}

// Every test gets a private temporary directory, which must be empty again
// when the test ends: no failure may leave a temporary file behind.
class SortFileTest : public ::testing::Test {
 protected:
  void TearDown() override {
    EXPECT_TRUE(temp.Entries().empty()) << "files left in " << temp.Path();
  }

  PrivateTempDirectory temp;
  ReportCapture reports;
};

TEST_F(SortFileTest, SortsByKeyArrayStably) {
  SortContext c;
  FillRecords(c, 3, 5000, TestSeed(1));
  const SortFileResult r = RunSortFile(c, {1, -1, 0});  // variable 1, descending, numeric
  EXPECT_EQ(r.code, 0);
  EXPECT_EQ(r.arg10, 0);
  EXPECT_EQ(r.arg11, 0);
  EXPECT_TRUE(SameBits(c.output, StableByFirstValue(c, false)));
  EXPECT_TRUE(reports.Reports().empty());
}

TEST_F(SortFileTest, DirectionZeroSortsDescendingAndPositiveAscending) {
  SortContext down, up;
  FillRecords(down, 2, 300, 2);
  FillRecords(up, 2, 300, 2);
  EXPECT_EQ(RunSortFile(down, {1, 0, 0}).code, 0);
  EXPECT_EQ(RunSortFile(up, {1, 5, 0}).code, 0);
  EXPECT_TRUE(SameBits(down.output, StableByFirstValue(down, false)));
  EXPECT_TRUE(SameBits(up.output, StableByFirstValue(up, true)));
}

TEST_F(SortFileTest, SpilledSortMatchesOracleAndLeavesNoFile) {
  SmallBatches small;
  vexahost::ScopedFaultPlan counting(vexahost::FaultPlan{});  // counts file operations only
  SortContext c;
  FillRecords(c, 4, 400000, TestSeed(3));
  EXPECT_EQ(RunSortFile(c, {1, 1, 0}).code, 0);
  EXPECT_GT(vexahost::FileOperationsSeen(vexahost::FileOp::Create), 1u) << "the sort did not spill";
  EXPECT_TRUE(SameBits(c.output, StableByFirstValue(c, true)));
}

TEST_F(SortFileTest, EmptyInputCallsNoOutput) {
  SortContext c;
  c.nvars = 2;
  const SortFileResult r = RunSortFile(c, {1, 1, 0});
  EXPECT_EQ(r.code, 0);
  EXPECT_EQ(c.inputCalls, 1u);
  EXPECT_EQ(c.outputCalls, 0u);
  EXPECT_EQ(r.arg10, 0);
  EXPECT_EQ(r.arg11, 0);
}

// The output function's nonzero value stops the sort at that record, whether
// the records come straight from a worker's batch or from the final merge.
TEST_F(SortFileTest, OutputResultStopsTheSort) {
  for (bool spill : {false, true}) {
    SCOPED_TRACE(spill ? "merged" : "direct");
    std::unique_ptr<SmallBatches> small(spill ? new SmallBatches : nullptr);
    SortContext c;
    FillRecords(c, 4, spill ? 300000 : 1000, 4);
    c.outputResult = [](std::size_t) { return FortranInt{7}; };
    const SortFileResult r = RunSortFile(c, {1, 1, 0});
    EXPECT_EQ(r.code, 7);
    EXPECT_EQ(c.outputCalls, 1u);
    EXPECT_EQ(r.arg10, 0);
    EXPECT_EQ(r.arg11, 0);

    SortContext later;
    FillRecords(later, 4, spill ? 300000 : 1000, 4);
    later.outputResult = [](std::size_t k) { return FortranInt{k == 499 ? -3 : 0}; };
    EXPECT_EQ(RunSortFile(later, {1, 1, 0}).code, -3);
    EXPECT_EQ(later.outputCalls, 500u);
  }
}

TEST_F(SortFileTest, ErrorTextIsReportedAndGivesFive) {
  for (bool inOutput : {false, true}) {
    SCOPED_TRACE(inOutput ? "output" : "input");
    SortContext c;
    FillRecords(c, 2, 1000, 5);
    const ErrorText error("the card reader jammed at record 17", 3);
    if (inOutput) {
      c.outputResult = [&](std::size_t k) -> FortranInt {
        if (k == 17) throw error;
        return 0;
      };
    } else {
      c.beforeInput = [&](std::size_t k) {
        if (k == 17) throw error;
      };
    }
    const SortFileResult r = RunSortFile(c, {1, 1, 0});
    EXPECT_EQ(r.code, 5);
    EXPECT_EQ(r.arg10, 0);
    EXPECT_EQ(r.arg11, 0);
    EXPECT_TRUE(AnyContains(reports.Reports(), "the card reader jammed at record 17"));
  }
}

TEST_F(SortFileTest, TemporaryFileFailureIsReported) {
  SmallBatches small;
  vexahost::FaultPlan plan;
  plan.kind = vexahost::FileOp::Write;
  plan.nth = 3;
  plan.error = vexahost::kErrorNoSpace;
  vexahost::ScopedFaultPlan armed(plan);
  SortContext c;
  FillRecords(c, 4, 300000, 6);
  c.keepOutput = false;
  EXPECT_EQ(RunSortFile(c, {1, 1, 0}).code, 5);
  EXPECT_TRUE(vexahost::FaultInjected());
  EXPECT_TRUE(AnyContains(reports.Reports(), temp.Path()));
}

TEST_F(SortFileTest, BadAllocGivesEleven) {
  for (bool inOutput : {false, true}) {
    SCOPED_TRACE(inOutput ? "output" : "input");
    SortContext c;
    FillRecords(c, 2, 1000, 7);
    if (inOutput) {
      c.outputResult = [](std::size_t k) -> FortranInt {
        if (k == 3) throw std::bad_alloc();
        return 0;
      };
    } else {
      c.beforeInput = [](std::size_t k) {
        if (k == 3) throw std::bad_alloc();
      };
    }
    const SortFileResult r = RunSortFile(c, {1, 1, 0});
    EXPECT_EQ(r.code, 11);
    EXPECT_EQ(r.arg10, 0);
    EXPECT_EQ(r.arg11, 0);
  }
}

TEST_F(SortFileTest, GoToCallerGivesFourteen) {
  for (bool spill : {false, true}) {
    SCOPED_TRACE(spill ? "merged" : "direct");
    std::unique_ptr<SmallBatches> small(spill ? new SmallBatches : nullptr);
    SortContext c;
    FillRecords(c, 4, spill ? 300000 : 1000, 8);
    c.keepOutput = false;
    c.outputResult = [](std::size_t k) -> FortranInt {
      if (k == 100) throw VexaGoToCaller();
      return 0;
    };
    const SortFileResult r = RunSortFile(c, {1, 1, 0});
    EXPECT_EQ(r.code, 14);
    EXPECT_EQ(c.outputCalls, 101u);
    EXPECT_EQ(r.arg10, 0);
    EXPECT_EQ(r.arg11, 0);
  }
}

TEST_F(SortFileTest, KeyOutsideRecordGivesFiveWithClearMessage) {
  const std::vector<std::vector<FortranInt>> keyArrays = {
      {4, 1, 0},   // variable 4 of 3
      {0, 1, 0},   // variable 0
      {3, 1, 9},   // a 9-byte string from the last variable needs two
      {1, 1, -1},  // a negative width is a huge one
  };
  for (const auto& ukeys : keyArrays) {
    SortContext c;
    FillRecords(c, 3, 10, 9);
    const SortFileResult r = RunSortFile(c, ukeys);
    EXPECT_EQ(r.code, 5);
    EXPECT_EQ(c.inputCalls, 0u);
    EXPECT_EQ(c.outputCalls, 0u);
  }
  const std::vector<std::string> all = reports.Reports();
  ASSERT_EQ(all.size(), keyArrays.size());
  EXPECT_NE(all[0].find("outside the record"), std::string::npos) << all[0];
}

// Each failed precondition is reported with its expression text and this
// file's name; the call then ends at once with 5.
TEST_F(SortFileTest, PreconditionsAreReportedAndNothingIsCalled) {
  struct Case {
    const char* name;
    bool nvarsNull;
    FortranInt nvars;
    bool nukeysNull;
    FortranInt nukeys;
    bool ukeysNull;
    std::vector<std::string> expected;
  };
  const std::vector<Case> cases = {
      {"nvars 0", false, 0, false, 1, false, {"nvars"}},
      {"nvars negative", false, -4, false, 1, false, {"nvars"}},
      {"nvars null", true, 0, false, 1, false, {"nvars"}},
      {"nukeys 0", false, 3, false, 0, false, {"nukeys"}},
      {"nukeys negative", false, 3, false, -1, false, {"nukeys"}},
      {"nukeys null", false, 3, true, 0, false, {"nukeys"}},
      {"ukeys null", false, 3, false, 1, true, {"ukeys"}},
      {"all three", false, 0, false, 0, true, {"nvars", "nukeys", "ukeys"}},
  };
  for (const Case& k : cases) {
    SCOPED_TRACE(k.name);
    ReportCapture capture;
    SortContext c;
    FillRecords(c, 3, 10, 10);
    const FortranInt ukeys[3] = {1, 1, 0};
    FortranInt a10 = 99, a11 = 98;
    const FortranInt code =
        SORTFILE(&c, ContextInput, ContextOutput, k.nvarsNull ? nullptr : &k.nvars,
                 k.ukeysNull ? nullptr : ukeys, k.nukeysNull ? nullptr : &k.nukeys, nullptr,
                 nullptr, nullptr, &a10, &a11);
    EXPECT_EQ(code, 5);
    EXPECT_EQ(a10, 0);
    EXPECT_EQ(a11, 0);
    EXPECT_EQ(c.inputCalls, 0u);
    EXPECT_EQ(c.outputCalls, 0u);
    const std::vector<std::string> got = capture.Reports();
    ASSERT_EQ(got.size(), k.expected.size());
    for (std::size_t i = 0; i < got.size(); ++i) {
      EXPECT_EQ(got[i].find("Assertion failed: " + k.expected[i] +
                            ", file backend/isort/sortfile.cpp, line "),
                0u)
          << got[i];
    }
  }
}

TEST_F(SortFileTest, ResultArgumentsMayBeNull) {
  SortContext c;
  FillRecords(c, 2, 10, 11);
  const FortranInt ukeys[3] = {1, 1, 0}, nukeys = 1;
  EXPECT_EQ(SORTFILE(&c, ContextInput, ContextOutput, &c.nvars, ukeys, &nukeys, nullptr, nullptr,
                     nullptr, nullptr, nullptr),
            0);
  EXPECT_EQ(c.outputCalls, 10u);
}

TEST(MakeCSortKeys, ConvertsTheThreeBlocksAndAppends) {
  const FortranInt ukeys[9] = {3, 1, 7, /*directions*/ 1, 0, -5, /*widths*/ 0, 12, 8};
  std::vector<FileSort::SortKey> keys = {{9, 1, 0}};
  MakeCSortKeys(ukeys, 3, keys);
  ASSERT_EQ(keys.size(), 4u);
  EXPECT_EQ(keys[0].variable, 9);
  EXPECT_EQ(keys[1].variable, 2);
  EXPECT_EQ(keys[1].direction, 1);
  EXPECT_EQ(keys[1].width, 0u);
  EXPECT_EQ(keys[2].variable, 0);
  EXPECT_EQ(keys[2].direction, -1);
  EXPECT_EQ(keys[2].width, 12u);
  EXPECT_EQ(keys[3].variable, 6);
  EXPECT_EQ(keys[3].direction, -1);
  EXPECT_EQ(keys[3].width, 8u);
}

TEST(SortFileSorter, RecordBufferBeyond32BitsThrowsBadAlloc) {
  const std::vector<FileSort::SortKey> keys = {{0, 1, 0}};
  EXPECT_THROW(SortFileSorter(nullptr, ContextInput, ContextOutput, 0x20000000, keys),
               std::bad_alloc);
}

}  // namespace
