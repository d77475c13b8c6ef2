// SORTFILE: order against a stable sort, return codes, reports, argument
// checks, and that no call leaves a temporary file behind.
#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "host/faultplan.h"
#include "isort/host/errhub.h"
#include "sortfile_testing.h"

namespace {

using namespace sortfile_testing;

// The context behind SORTFILE's callbacks, with hooks that may fail a
// callback (throw or return nonzero) at record k, counted from 0.
struct SortContext {
  FortranInt nvars = 5;
  std::vector<OBS> input, output;  // records back to back
  std::size_t inputCalls = 0, outputCalls = 0;
  std::function<void(std::size_t k)> beforeInput;
  std::function<FortranInt(std::size_t k)> outputResult;
  FortranInt arg10 = 99, arg11 = 99;  // SORTFILE's statistics outputs
};

FortranInt VEXA_STDCALL ContextInput(void* context, OBS* buffer, FortranInt* nvars) {
  SortContext& c = *static_cast<SortContext*>(context);
  const std::size_t k = c.inputCalls++;
  if (c.beforeInput) c.beforeInput(k);
  if (*nvars != c.nvars) ADD_FAILURE() << "input function got nvars " << *nvars;
  if (k * c.nvars >= c.input.size()) return 1;
  std::memcpy(buffer, &c.input[k * c.nvars], sizeof(OBS) * c.nvars);
  return 0;
}

FortranInt VEXA_STDCALL ContextOutput(void* context, const OBS* record, FortranInt* nvars) {
  SortContext& c = *static_cast<SortContext*>(context);
  const std::size_t k = c.outputCalls++;
  if (*nvars != c.nvars) ADD_FAILURE() << "output function got nvars " << *nvars;
  c.output.insert(c.output.end(), record, record + c.nvars);
  return c.outputResult ? c.outputResult(k) : 0;
}

// Arguments 10 and 11 may be null (`nullResults`); otherwise both must be 0 after the call.
FortranInt RunSortFile(SortContext& c, const std::vector<FortranInt>& ukeys,
                       bool nullResults = false) {
  const FortranInt nukeys = static_cast<FortranInt>(ukeys.size() / 3);
  const FortranInt code =
      SORTFILE(&c, ContextInput, ContextOutput, &c.nvars, ukeys.data(), &nukeys, nullptr, nullptr,
               nullptr, nullResults ? nullptr : &c.arg10, nullResults ? nullptr : &c.arg11);
  EXPECT_EQ(c.arg10, nullResults ? 99 : 0);
  EXPECT_EQ(c.arg11, nullResults ? 99 : 0);
  return code;
}

// Every test gets a private temporary directory that must be empty at its end.
class SortFileTest : public ::testing::Test {
 protected:
  void TearDown() override { EXPECT_TRUE(temp.Empty()) << "files left in " << temp.Path(); }

  // Records of five values: a numeric key with many ties, 12 bytes of text
  // with many ties (values 2 and 3), another number, and the input position.
  void Fill(SortContext& c, std::size_t records) {
    c.input.resize(records * 5);
    for (std::size_t r = 0; r < records; ++r) {
      OBS* record = &c.input[r * 5];
      SetDouble(record, static_cast<double>(random() % 20) - 10.0);
      std::string text(random() % 13, 'A');
      for (char& ch : text) ch = "AB "[random() % 3];
      SetText(record + 1, text, 12);
      SetDouble(record + 3, static_cast<double>(random() % 1000));
      SetDouble(record + 4, static_cast<double>(r));
    }
  }

  PrivateTempDirectory temp;
  ReportCapture reports;
  std::mt19937 random{TestSeed(1)};
};

// Random key sets in memory (any positive direction ascends, 0 and below
// descend; the first input is empty), then a sort that spills runs and merges them.
TEST_F(SortFileTest, OrderMatchesStableSort) {
  const int directions[] = {1, 5, 0, -1, -7};
  for (int trial = 0; trial < 40; ++trial) {
    SCOPED_TRACE(trial);
    SortContext c;
    Fill(c, trial == 0 ? 0 : 1 + random() % 3000);
    std::vector<Key> keys;
    for (int k = 1 + random() % 3; k > 0; --k) {
      const FortranInt d = directions[random() % 5];
      const FortranInt width = static_cast<FortranInt>(1 + random() % 16);
      const Key pool[] = {{1, d, 0}, {2, d, width}, {3, d, 8}, {4, d, 0}, {4, d, 8}};
      keys.push_back(pool[random() % 5]);
    }
    EXPECT_EQ(RunSortFile(c, KeyArray(keys), trial % 4 == 3), 0);
    EXPECT_EQ(c.inputCalls, c.input.size() / 5 + 1);  // none after the end
    ASSERT_TRUE(SameBits(c.output, OracleSort(c.input, c.nvars, keys)));
  }
  SmallBatches small;
  vexahost::ScopedFaultPlan counting(vexahost::FaultPlan{});  // counts file operations only
  SortContext c;
  Fill(c, 400000);
  const std::vector<Key> keys = {{1, -1, 0}, {2, 1, 12}};
  EXPECT_EQ(RunSortFile(c, KeyArray(keys)), 0);
  EXPECT_GT(vexahost::FileOperationsSeen(vexahost::FileOp::Create), 1u) << "the sort did not spill";
  EXPECT_TRUE(SameBits(c.output, OracleSort(c.input, c.nvars, keys)));
  EXPECT_TRUE(reports.Reports().empty());
}

// A callback ends the sort at record k: ErrorText gives 5 and is reported,
// std::bad_alloc 11, VexaGoToCaller 14, and a nonzero value of the output
// function is returned; in memory or after runs were spilled, no output
// call follows and no temporary file is left.
TEST_F(SortFileTest, CallbackEndsTheSort) {
  const FortranInt codes[] = {5, 11, 14, -3};
  for (int kind = 0; kind < 4; ++kind) {
    for (bool inOutput : {false, true}) {
      for (bool spill : {false, true}) {
        if (kind == 3 && !inOutput) continue;
        const std::string text =
            "card reader jammed, case " + std::to_string(kind * 4 + inOutput * 2 + spill);
        SCOPED_TRACE(text);
        std::unique_ptr<SmallBatches> small(spill ? new SmallBatches : nullptr);
        const std::size_t at = inOutput ? (spill ? 499 : 0) : (spill ? 250000 : 100);
        auto fail = [&](std::size_t k) {
          if (k != at) return FortranInt{0};
          if (kind == 0) throw ErrorText(text, 3);
          if (kind == 1) throw std::bad_alloc();
          if (kind == 2) throw VexaGoToCaller();
          return codes[kind];
        };
        SortContext c;
        Fill(c, spill ? 300000 : 1000);
        if (inOutput) {
          c.outputResult = fail;
        } else {
          c.beforeInput = fail;
        }
        EXPECT_EQ(RunSortFile(c, {1, 1, 0}), codes[kind]);
        EXPECT_EQ(c.outputCalls, inOutput ? at + 1 : 0);
        const std::vector<std::string> all = reports.Reports();
        EXPECT_EQ(std::find(all.begin(), all.end(), text) != all.end(), kind == 0);
        EXPECT_TRUE(temp.Empty());
      }
    }
  }
}

// Failed preconditions are reported with their expression text and this
// file's name, keys outside the record with a plain message; the call then
// ends without calling back.
TEST_F(SortFileTest, BadArgumentsAreReportedAndNothingIsCalled) {
  constexpr FortranInt kNull = -99999;  // pass a null pointer
  const std::string assertion = "Assertion failed: ";
  const std::string where = ", file backend/isort/sortfile.cpp, line ";
  const std::string nvars = assertion + "nvars" + where, nukeys = assertion + "nukeys" + where,
                    ukeys = assertion + "ukeys" + where, outside = "outside the record";
  struct Case {
    FortranInt nvars, nukeys;
    std::vector<FortranInt> ukeys;  // empty: a null pointer
    FortranInt code;
    std::vector<std::string> reports;
  };
  const std::vector<Case> cases = {
      {0, 1, {1, 1, 0}, 5, {nvars}},
      {-4, 1, {1, 1, 0}, 5, {nvars}},
      {kNull, 1, {1, 1, 0}, 5, {nvars}},
      {3, 0, {1, 1, 0}, 5, {nukeys}},
      {3, -1, {1, 1, 0}, 5, {nukeys}},
      {3, kNull, {1, 1, 0}, 5, {nukeys}},
      {3, 1, {}, 5, {ukeys}},
      {0, 0, {}, 5, {nvars, nukeys, ukeys}},
      {3, 1, {4, 1, 0}, 5, {outside}},
      {3, 1, {0, 1, 0}, 5, {outside}},
      {3, 1, {3, 1, 9}, 5, {outside}},     // a 9-byte string from the last value needs two
      {3, 1, {1, 1, -1}, 5, {outside}},    // a negative width is a huge one
      {0x20000000, 1, {1, 1, 0}, 11, {}},  // a record of more than 4 GiB
  };
  for (const Case& k : cases) {
    SCOPED_TRACE(testing::Message() << k.nvars << " " << k.nukeys << " " << k.ukeys.size());
    const std::size_t seen = reports.Reports().size();
    SortContext c;
    const FortranInt code = SORTFILE(
        &c, ContextInput, ContextOutput, k.nvars == kNull ? nullptr : &k.nvars,
        k.ukeys.empty() ? nullptr : k.ukeys.data(), k.nukeys == kNull ? nullptr : &k.nukeys,
        nullptr, nullptr, nullptr, &c.arg10, &c.arg11);
    EXPECT_EQ(code, k.code);
    EXPECT_EQ(c.arg10, 0);
    EXPECT_EQ(c.arg11, 0);
    EXPECT_EQ(c.inputCalls + c.outputCalls, 0u);
    const std::vector<std::string> all = reports.Reports();
    ASSERT_EQ(all.size() - seen, k.reports.size());
    for (std::size_t i = 0; i < k.reports.size(); ++i) {
      const std::size_t at = all[seen + i].find(k.reports[i]);
      EXPECT_TRUE(k.reports[i] == outside ? at != std::string::npos : at == 0) << all[seen + i];
    }
  }
}

// The conversion itself is checked through SORTFILE's order; here, that
// the keys are appended to what the vector holds.
TEST(MakeCSortKeys, AppendsToTheVector) {
  const FortranInt ukeys[3] = {7, -1, 8};
  std::vector<FileSort::SortKey> keys = {{9, 1, 0}};
  MakeCSortKeys(ukeys, 1, keys);
  ASSERT_EQ(keys.size(), 2u);
  EXPECT_EQ(keys[0].variable, 9);
  EXPECT_EQ(keys[1].variable, 6);
  EXPECT_EQ(keys[1].direction, -1);
  EXPECT_EQ(keys[1].width, 8u);
}

}  // namespace
