#include "fault_harness.h"

#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <thread>

#include "host/faultplan.h"
#include "host/hostsettings.h"

namespace faults {

using testing_support::Bits;
using testing_support::FromBits;
using testing_support::FromText;

namespace {

int CountEntries(const char* directory) {
  DIR* dir = opendir(directory);
  if (!dir) return -1;
  int n = 0;
  while (dirent* e = readdir(dir)) {
    if (std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0) ++n;
  }
  closedir(dir);
  return n;
}

}  // namespace

int CountOpenFiles() {
  // The directory's own descriptor is counted every time alike.
  return CountEntries("/proc/self/fd");
}

int CountThreads() { return CountEntries("/proc/self/task"); }

std::vector<std::uint64_t> FaultPoints(std::uint64_t total) {
  std::vector<std::uint64_t> points;
  if (total <= 2000) {
    for (std::uint64_t i = 1; i <= total; ++i) points.push_back(i);
    return points;
  }
  for (std::uint64_t i = 1; i <= 200; ++i) points.push_back(i);
  const std::uint64_t first = 201, last = total - 200;  // the span between
  for (std::uint64_t k = 0; k < 200; ++k) points.push_back(first + (last - first) * k / 200);
  for (std::uint64_t i = total - 199; i <= total; ++i) points.push_back(i);
  points.erase(std::unique(points.begin(), points.end()), points.end());
  return points;
}

Records MakeRecords(std::size_t count, unsigned nvars, std::uint64_t seed) {
  std::mt19937_64 rng(seed);
  Records r;
  r.nvars = nvars < 2 ? 2 : nvars;
  r.count = count;
  r.keys = {{0, 1, 0}};
  if (r.nvars >= 4) r.keys.push_back({2, -1, 8});
  r.values.resize(count * r.nvars);
  static const char kLetters[] = "ABab";
  for (std::size_t i = 0; i < count; ++i) {
    OBS* rec = &r.values[i * r.nvars];
    for (unsigned v = 2; v < r.nvars; ++v) rec[v] = testing_support::AwkwardValue(rng);
    rec[0] = static_cast<double>(static_cast<int>(rng() % 23) - 5);
    rec[1] = static_cast<double>(i);
    if (r.nvars >= 4) {
      char text[8];
      for (char& c : text) c = kLetters[rng() % 4];
      std::memcpy(&rec[2], text, 8);
    }
  }
  r.expected = testing_support::OracleSort(r.values, count, r.nvars, r.keys);
  return r;
}

bool CallLog::DeliveredPrefixOf(const std::vector<OBS>& expected, unsigned nvars) const {
  const std::size_t n = puts * nvars;
  return n <= expected.size() && n <= output.size() &&
         (n == 0 || std::memcmp(output.data(), expected.data(), n * sizeof(OBS)) == 0);
}

HookedSort::HookedSort(const Records& r, CallLog& log, Statistics* stats)
    : FileSort(r.keys, r.nvars, stats), records_(r), log_(log) {}

const OBS* HookedSort::GetRecord() {
  const std::size_t call = log_.gets++;
  if (log_.threw) log_.calledAfterThrow = true;
  if (log_.beforeGet) log_.beforeGet(call);
  return call < records_.count ? &records_.values[call * records_.nvars] : nullptr;
}

void HookedSort::PutRecord(const OBS* record) {
  const std::size_t call = log_.puts;
  if (log_.threw) log_.calledAfterThrow = true;
  if (log_.beforePut) log_.beforePut(call);
  if (call >= records_.count) {
    log_.overflow = true;
    return;
  }
  std::memcpy(&log_.output[call * records_.nvars], record, records_.nvars * sizeof(OBS));
  ++log_.puts;
}

void MakeItSpill(FileSort& sort) {
  FileSortAccess::DataOf(sort).memoryTarget = kSpillTarget;
  vexahost::SetStreamBufferSize(kSpillBuffer);
}

const char* Name(Ending e) {
  switch (e) {
    case Ending::Completed:
      return "completed";
    case Ending::BadAlloc:
      return "std::bad_alloc";
    case Ending::Error:
      return "ErrorText";
    case Ending::GoToCaller:
      return "VexaGoToCaller";
    case Ending::Foreign:
      return "a foreign exception";
    case Ending::Other:
      return "an unexpected exception";
  }
  return "?";
}

Ending CurrentEnding(std::string* text) {
  try {
    throw;
  } catch (const std::bad_alloc&) {
    return Ending::BadAlloc;
  } catch (const ErrorText& e) {
    if (text) *text = e.Text();
    return Ending::Error;
  } catch (const VexaGoToCaller&) {
    return Ending::GoToCaller;
  } catch (const ForeignFailure&) {
    return Ending::Foreign;
  } catch (...) {
    return Ending::Other;
  }
}

Ending RunSort(FileSort& sort, std::string* text) {
  try {
    sort.Sort();
    return Ending::Completed;
  } catch (...) {
    return CurrentEnding(text);
  }
}

std::vector<FortranInt> SortFileKeys(const Records& r) {
  const std::size_t n = r.keys.size();
  std::vector<FortranInt> ukeys(3 * n);
  for (std::size_t i = 0; i < n; ++i) {
    ukeys[i] = r.keys[i].variable + 1;
    ukeys[n + i] = r.keys[i].direction;
    ukeys[2 * n + i] = static_cast<FortranInt>(r.keys[i].width);
  }
  return ukeys;
}

namespace {

struct SortFileContext {
  const Records* records;
  CallLog* log;
};

FortranInt VEXA_STDCALL HookedInput(void* context, OBS* buffer, FortranInt* nvars) {
  SortFileContext& c = *static_cast<SortFileContext*>(context);
  CallLog& log = *c.log;
  const std::size_t call = log.gets++;
  if (log.threw) log.calledAfterThrow = true;
  if (log.beforeGet) log.beforeGet(call);
  if (call >= c.records->count) return 1;
  std::memcpy(buffer, &c.records->values[call * c.records->nvars],
              static_cast<std::size_t>(*nvars) * sizeof(OBS));
  return 0;
}

FortranInt VEXA_STDCALL HookedOutput(void* context, const OBS* record, FortranInt* nvars) {
  SortFileContext& c = *static_cast<SortFileContext*>(context);
  CallLog& log = *c.log;
  const std::size_t call = log.puts;
  if (log.threw) log.calledAfterThrow = true;
  if (log.beforePut) log.beforePut(call);
  if (call >= c.records->count) {
    log.overflow = true;
    return 0;
  }
  std::memcpy(&log.output[call * c.records->nvars], record,
              static_cast<std::size_t>(*nvars) * sizeof(OBS));
  ++log.puts;
  return 0;
}

}  // namespace

FortranInt CallSortFile(const Records& r, const std::vector<FortranInt>& ukeys, CallLog& log,
                        Ending* ending) {
  SortFileContext context{&r, &log};
  const FortranInt nvars = static_cast<FortranInt>(r.nvars);
  const FortranInt nukeys = static_cast<FortranInt>(ukeys.size() / 3);
  FortranInt a10 = 7, a11 = 7;
  try {
    const FortranInt code = SORTFILE(&context, HookedInput, HookedOutput, &nvars, ukeys.data(),
                                     &nukeys, nullptr, nullptr, nullptr, &a10, &a11);
    if (a10 != 0 || a11 != 0) ADD_FAILURE() << "SORTFILE left arguments 10 and 11 unset";
    if (ending) *ending = Ending::Completed;
    return code;
  } catch (...) {
    if (ending) *ending = CurrentEnding();
    if (a10 != 0 || a11 != 0) ADD_FAILURE() << "SORTFILE left arguments 10 and 11 unset";
    return -1;
  }
}

bool SortFileSpills(const Records& r) {
  CallLog log(r);
  Ending ending;
  vexahost::ScopedFaultPlan counting(vexahost::FaultPlan{});
  const FortranInt code = CallSortFile(r, SortFileKeys(r), log, &ending);
  return code == 0 && log.puts == r.count &&
         vexahost::FileOperationsSeen(vexahost::FileOp::Read) > 0;
}

bool IsPermutationOfInput(const Records& r, const std::vector<OBS>& output) {
  if (output.size() != r.values.size()) return false;
  std::vector<char> seen(r.count, 0);
  for (std::size_t i = 0; i < r.count; ++i) {
    const OBS* rec = &output[i * r.nvars];
    const double id = rec[1];
    if (!(id >= 0 && id < static_cast<double>(r.count))) return false;
    const std::size_t k = static_cast<std::size_t>(id);
    if (seen[k]++) return false;
    if (std::memcmp(rec, &r.values[k * r.nvars], r.nvars * sizeof(OBS)) != 0) return false;
  }
  return true;
}

// ---- the fixture

void FaultTest::SetUpTestSuite() {
  // One spilling sort on three workers before anything is counted, so that
  // what the libraries set up once per process is not taken for a leak.
  Records r = MakeRecords(1500, 4, 1);
  CallLog log(r);
  vexahost::SetProcessorCounts(1, 3);
  vexahost::SetThreadSetting(3);
  {
    HookedSort sort(r, log);
    MakeItSpill(sort);
    sort.Sort();
  }
  vexahost::SetStreamBufferSize(0);
  vexahost::SetProcessorCounts(0, 0);
  vexahost::SetThreadSetting(0);
}

void FaultTest::SetUp() {
  SortTest::SetUp();
  {
    // The test framework keeps its trace stack's storage once it has grown;
    // let it grow before the count starts.
    SCOPED_TRACE("outer");
    SCOPED_TRACE("inner");
  }
  ArmAllocations(AllocationPlan{});
  atStart_ = Now();
}

Resources FaultTest::Now() const {
  Resources r;
  r.liveBytes = LiveBytes();
  r.openFiles = CountOpenFiles();
  r.threads = CountThreads();
  return r;
}

bool FaultTest::ExpectReleased(const Resources& before, const char* what, std::uint64_t point) {
  const Resources now = Now();
  int threads = now.threads;
  // A joined thread may linger in the task list for a moment while the
  // kernel reaps it; give it that moment, not an open-ended wait.
  for (int i = 0; i < 2000 && threads > before.threads; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
    threads = CountThreads();
  }
  const bool files = Leftovers().empty();
  const bool ok = files && now.liveBytes == before.liveBytes && now.openFiles == before.openFiles &&
                  threads == before.threads;
  if (!ok) {
    ADD_FAILURE() << what << " at point " << point << ": "
                  << (files ? "" : "temporary files left; ") << "live bytes " << before.liveBytes
                  << " -> " << now.liveBytes << " (" << LiveBlocks() << " blocks), open files "
                  << before.openFiles << " -> " << now.openFiles << ", threads " << before.threads
                  << " -> " << threads;
  }
  return ok;
}

void FaultTest::TearDown() {
  vexahost::DisarmFaultPlan();
  ArmAllocations(AllocationPlan{});
  ExpectReleased(atStart_, "end of test", 0);

  // The process is still fit to sort: a spilling sort on three workers.
  vexahost::SetTempDirectory(tempDir_);
  UseThreads(3);
  {
    Records r = MakeRecords(2000, 4, 77);
    CallLog log(r);
    HookedSort sort(r, log);
    MakeItSpill(sort);
    EXPECT_EQ(RunSort(sort), Ending::Completed) << "a sort after the faults";
    EXPECT_EQ(log.puts, r.count);
    EXPECT_TRUE(log.DeliveredPrefixOf(r.expected, r.nvars)) << "a sort after the faults";
  }
  ExpectReleased(atStart_, "sort after the test", 0);
  DisarmAllocations();
  vexahost::SetReportSink(nullptr);
  SortTest::TearDown();
}

}  // namespace faults
