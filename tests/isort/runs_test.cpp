// Runs in temporary files: reading them back, giving up copied files, and
// choosing how many runs a merge pass takes.
#include <gtest/gtest.h>

#include <memory>

#include "sort_harness.h"

using namespace testing_support;

namespace {

class Runs : public SortTest {
 protected:
  // Writes records of one key value, the tag, and one rest value.
  void WriteRecord(FileSort::WorkFile& file, double key, double tag, double rest) {
    OBS entry[2] = {key, tag};
    WriteCompressed(file, entry, 2);
    WriteCompressed(file, &rest, 1);
  }
  std::vector<std::string> reports_;
  void CaptureReports() {
    vexahost::SetReportSink([this](const std::string& m) { reports_.push_back(m); });
  }
  void TearDown() override {
    vexahost::SetReportSink(nullptr);
    SortTest::TearDown();
  }
};

}  // namespace

TEST_F(Runs, TagsReadBackAsRunNumbers) {
  FileSort::WorkFile file("sort");
  WriteRecord(file, 1.0, -99.0, 10.0);
  WriteRecord(file, 2.0, 51.0, 20.0);
  WriteRecord(file, 3.0, 151.0, 30.0);
  WriteRecord(file, 4.0, 1000.0, 40.0);
  RunDescriptor run(0, file.Tell(), &file, false);
  RunReader reader(run);
  reader.Open();
  reader.Allocate(1, 1);
  const std::uint32_t expect[] = {0, 150, 250, 1099};
  for (std::uint32_t e : expect) {
    ASSERT_TRUE(reader.ReadNext());
    EXPECT_EQ(TagLowWord(reader.entry + 1), e);
  }
  EXPECT_EQ(reader.rest[0], 40.0);
  EXPECT_FALSE(reader.ReadNext());
  EXPECT_FALSE(reader.ReadNext());
}

TEST_F(Runs, ReadersStopAtTheirOwnEnds) {
  FileSort::WorkFile file("sort");
  const std::int64_t a = file.Tell();
  for (int i = 0; i < 50; ++i) WriteRecord(file, i, -99.0, i * 10.0);
  const std::int64_t b = file.Tell();
  for (int i = 0; i < 30; ++i) WriteRecord(file, 100 + i, -98.0, i * 20.0);
  const std::int64_t c = file.Tell();
  RunDescriptor first(a, b, &file, false), second(b, c, &file, false), empty(c, c, &file, false);
  RunReader r1(first), r2(second), r3(empty);
  for (RunReader* r : {&r1, &r2, &r3}) {
    r->Open();
    r->Allocate(1, 1);
  }
  EXPECT_FALSE(r3.ReadNext());
  // Alternately, each at its own position.
  for (int i = 0; i < 50; ++i) {
    ASSERT_TRUE(r1.ReadNext());
    EXPECT_EQ(r1.entry[0], i);
    EXPECT_EQ(r1.rest[0], i * 10.0);
    if (i < 30) {
      ASSERT_TRUE(r2.ReadNext());
      EXPECT_EQ(r2.entry[0], 100 + i);
      EXPECT_EQ(TagLowWord(r2.entry + 1), 1u);
    }
  }
  EXPECT_FALSE(r1.ReadNext());
  EXPECT_FALSE(r2.ReadNext());
}

TEST_F(Runs, NoRestPart) {
  FileSort::WorkFile file("sort");
  OBS entry[3] = {1.0, 2.0, -97.0};
  WriteCompressed(file, entry, 3);
  RunDescriptor run(0, file.Tell(), &file, false);
  RunReader reader(run);
  reader.Open();
  reader.Allocate(2, 0);
  EXPECT_EQ(reader.rest, nullptr);
  ASSERT_TRUE(reader.ReadNext());
  EXPECT_EQ(TagLowWord(reader.entry + 2), 2u);
  EXPECT_FALSE(reader.ReadNext());
}

// A damaged file must stop the merge with an error, never loop or go on.
TEST_F(Runs, DamagedRunsThrow) {
  CaptureReports();
  FileSort::WorkFile file("sort");
  WriteRecord(file, 1.0, -99.0, 5.0);
  const std::int64_t good = file.Tell();
  {  // The run claims more bytes than the file holds.
    RunDescriptor run(0, good + 40, &file, false);
    RunReader reader(run);
    reader.Open();
    reader.Allocate(1, 1);
    ASSERT_TRUE(reader.ReadNext());
    EXPECT_THROW(reader.ReadNext(), ErrorText);
  }
  {  // An entry whose rest part lies outside the run.
    OBS entry[2] = {2.0, -99.0};
    const std::int64_t start = file.Tell();
    WriteCompressed(file, entry, 2);
    RunDescriptor run(start, file.Tell(), &file, false);
    RunReader reader(run);
    reader.Open();
    reader.Allocate(1, 1);
    EXPECT_THROW(reader.ReadNext(), ErrorText);
    ASSERT_FALSE(reports_.empty());
    EXPECT_NE(reports_.back().find("more"), std::string::npos) << reports_.back();
  }
  {  // Bytes that are no record: undefined codes, a tag no run has.
    const std::int64_t start = file.Tell();
    const unsigned char junk[16] = {252, 252, 0, 0, 0, 0, 0, 0, 1, 2, 3, 4, 5, 6, 7, 8};
    file.Write(junk, sizeof junk);
    RunDescriptor run(start, file.Tell(), &file, false);
    RunReader reader(run);
    reader.Open();
    reader.Allocate(1, 1);
    try {
      reader.ReadNext();
      ADD_FAILURE() << "no error";
    } catch (const ErrorText& e) {
      EXPECT_NE(e.Text().find("damaged"), std::string::npos) << e.Text();
    }
  }
}

TEST_F(Runs, ReleaseSharedFilesKeepsOrderAndReferencedFiles) {
  std::vector<OBS> none;
  VectorSort sort({}, 1, &none, 0);
  FileSort::Data& data = sort.data();
  for (int i = 0; i < 5; ++i) data.workFiles.push_back(new FileSort::WorkFile("sort"));
  std::vector<FileSort::WorkFile*> files = data.workFiles;
  FileSort::WorkFile copy1(*files[1]), copy2(*files[2]);
  data.ReleaseSharedFiles();
  EXPECT_EQ(data.workFiles, (std::vector<FileSort::WorkFile*>{files[0], files[3], files[4]}));

  // A shared object that a run still waiting in the list points at stays.
  FileSort::WorkFile copy3(*files[3]);
  data.runs.emplace_back(0, 0, files[3], false);
  data.ReleaseSharedFiles();
  EXPECT_EQ(data.workFiles, (std::vector<FileSort::WorkFile*>{files[0], files[3], files[4]}));
  data.runs.clear();
  data.ReleaseSharedFiles();
  EXPECT_EQ(data.workFiles, (std::vector<FileSort::WorkFile*>{files[0], files[4]}));
}

namespace {

// The sizes of the passes a merge of n runs takes, each run with footprint
// F and the merge file too, simulated on hand-made descriptors.
std::vector<unsigned> Passes(FileSort::Data& data, unsigned n, unsigned M) {
  FileSort::WorkFile holder("sort");
  for (unsigned i = 0; i < n; ++i) data.runs.emplace_back(0, 0, &holder, false);
  std::vector<unsigned> passes;
  while (!data.runs.empty()) {
    FileSort::WorkFile mergeFile("merge");
    const unsigned k = std::max(data.ChooseFanIn(M, mergeFile), 2u);
    passes.push_back(std::min<unsigned>(k, static_cast<unsigned>(data.runs.size())));
    for (unsigned i = 0; i < k && !data.runs.empty(); ++i) data.runs.pop_front();
    if (!data.runs.empty()) data.runs.emplace_back(0, 0, &holder, false);
  }
  return passes;
}

}  // namespace

TEST_F(Runs, FanInFigures) {
  vexahost::SetStreamBufferSize(1 << 20);
  std::vector<OBS> none;
  VectorSort sort({}, 1, &none, 0);
  const unsigned M = 100u << 20;
  EXPECT_EQ(Passes(sort.data(), 98, M), (std::vector<unsigned>{98}));
  EXPECT_EQ(Passes(sort.data(), 150, M), (std::vector<unsigned>{54, 97}));
  EXPECT_EQ(Passes(sort.data(), 300, M), (std::vector<unsigned>{99, 99, 8, 97}));
  EXPECT_EQ(Passes(sort.data(), 1, M), (std::vector<unsigned>{1}));
}

// Footprints so large that not even two runs fit: every pass still takes
// two runs, so the merge ends, and the output is right.
TEST_F(Runs, HugeFootprintsStillMerge) {
  vexahost::SetStreamBufferSize(64 << 10);
  std::mt19937_64 rng(99);
  const std::size_t n = 20000;
  std::vector<OBS> input(n * 3);
  for (OBS& v : input) v = static_cast<double>(rng() % 50);
  std::vector<Key> keys{{1, 1, 0}};
  FileSort::Statistics stats;
  VectorSort sort(keys, 3, &input, n, &stats);
  sort.ForceMemoryTarget(32 << 10);
  sort.Sort();
  EXPECT_TRUE(SameBits(sort.output, OracleSort(input, n, 3, keys)));
  ASSERT_GE(stats.merges.size(), 2u);
  for (const auto& m : stats.merges) EXPECT_GE(m.runs, 1u);
  for (std::size_t i = 0; i + 1 < stats.merges.size(); ++i) EXPECT_EQ(stats.merges[i].runs, 2u);
}
