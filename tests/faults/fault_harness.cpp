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
  for (std::size_t i = 0; i < count; ++i) {
    OBS* rec = &r.values[i * r.nvars];
    for (unsigned v = 2; v < r.nvars; ++v) rec[v] = testing_support::AwkwardValue(rng);
    rec[0] = static_cast<double>(static_cast<int>(rng() % 23) - 5);
    rec[1] = static_cast<double>(i);
    if (r.nvars >= 4) {
      char text[8];
      for (char& c : text) c = "ABab"[rng() % 4];
      std::memcpy(&rec[2], text, 8);
    }
  }
  r.expected = testing_support::OracleSort(r.values, count, r.nvars, r.keys);
  return r;
}

const OBS* CallLog::Get() {
  const std::size_t call = gets++;
  if (threw) calledAfterThrow = true;
  if (beforeGet) beforeGet(call);
  return call < records.count ? &records.values[call * records.nvars] : nullptr;
}

void CallLog::Put(const OBS* record) {
  if (threw) calledAfterThrow = true;
  if (beforePut) beforePut(puts);
  if (puts >= records.count) {
    overflow = true;
    return;
  }
  std::memcpy(&output[puts * records.nvars], record, records.nvars * sizeof(OBS));
  ++puts;
}

bool CallLog::Prefix() const {
  const std::size_t n = puts * records.nvars;
  return n <= records.expected.size() && n <= output.size() &&
         (n == 0 || std::memcmp(output.data(), records.expected.data(), n * sizeof(OBS)) == 0);
}

void MakeItSpill(FileSort& sort) {
  FileSortAccess::DataOf(sort).memoryTarget = 4096;
  vexahost::SetStreamBufferSize(512);
}

const char* Name(Ending e) {
  static const char* const names[] = {"completed",           "std::bad_alloc",
                                      "ErrorText",           "VexaGoToCaller",
                                      "a foreign exception", "an unexpected exception"};
  return names[static_cast<int>(e)];
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

FortranInt VEXA_STDCALL HookedInput(void* context, OBS* buffer, FortranInt* nvars) {
  const OBS* record = static_cast<CallLog*>(context)->Get();
  if (!record) return 1;
  std::memcpy(buffer, record, static_cast<std::size_t>(*nvars) * sizeof(OBS));
  return 0;
}

FortranInt VEXA_STDCALL HookedOutput(void* context, const OBS* record, FortranInt*) {
  static_cast<CallLog*>(context)->Put(record);
  return 0;
}

}  // namespace

FortranInt CallSortFile(CallLog& log, const std::vector<FortranInt>& ukeys, Ending* ending) {
  const FortranInt nvars = static_cast<FortranInt>(log.records.nvars);
  const FortranInt nukeys = static_cast<FortranInt>(ukeys.size() / 3);
  FortranInt a10 = 7, a11 = 7, code = -1;
  *ending = Ending::Completed;
  try {
    code = SORTFILE(&log, HookedInput, HookedOutput, &nvars, ukeys.data(), &nukeys, nullptr,
                    nullptr, nullptr, &a10, &a11);
  } catch (...) {
    *ending = CurrentEnding();
  }
  if (a10 != 0 || a11 != 0) ADD_FAILURE() << "SORTFILE left arguments 10 and 11 unset";
  return code;
}

bool SortFileSpills(const Records& r) {
  CallLog log(r);
  Ending ending;
  vexahost::ScopedFaultPlan counting(vexahost::FaultPlan{});
  return CallSortFile(log, SortFileKeys(r), &ending) == 0 && log.puts == r.count &&
         vexahost::FileOperationsSeen(vexahost::FileOp::Read) > 0;
}

bool IsPermutationOfInput(const Records& r, const std::vector<OBS>& output) {
  if (output.size() != r.values.size()) return false;
  std::vector<char> seen(r.count, 0);
  for (std::size_t i = 0; i < r.count; ++i) {
    const OBS* rec = &output[i * r.nvars];
    if (!(rec[1] >= 0 && rec[1] < static_cast<double>(r.count))) return false;
    const std::size_t k = static_cast<std::size_t>(rec[1]);
    if (seen[k]++ || std::memcmp(rec, &r.values[k * r.nvars], r.nvars * sizeof(OBS)) != 0)
      return false;
  }
  return true;
}

// ---- the fixture

namespace {

// Entries of a directory; its own descriptor, while it is read, is counted
// every time alike.
int CountEntries(const char* directory) {
  DIR* dir = opendir(directory);
  if (!dir) return -1;
  int n = 0;
  while (dirent* e = readdir(dir))
    n += std::strcmp(e->d_name, ".") != 0 && std::strcmp(e->d_name, "..") != 0;
  closedir(dir);
  return n;
}

}  // namespace

void FaultTest::SetUpTestSuite() {
  // One spilling sort on three workers before anything is counted, so that
  // what the libraries set up once per process is not taken for a leak.
  const Records r = MakeRecords(1500, 4, 1);
  CallLog log(r);
  UseThreads(3);
  SortWith(log, MakeItSpill);
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
  return Resources{LiveBytes(), CountEntries("/proc/self/fd"), CountEntries("/proc/self/task")};
}

bool FaultTest::ExpectReleased(const Resources& before, const char* what, std::uint64_t point) {
  Resources now = Now();
  // A joined thread may linger in the task list for a moment while the
  // kernel reaps it; give it that moment, not an open-ended wait.
  for (int i = 0; i < 2000 && now.threads > before.threads; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
    now.threads = CountEntries("/proc/self/task");
  }
  const bool files = Leftovers().empty();
  const bool ok = files && now.liveBytes == before.liveBytes && now.openFiles == before.openFiles &&
                  now.threads == before.threads;
  if (!ok) {
    ADD_FAILURE() << what << " at point " << point << ": "
                  << (files ? "" : "temporary files left; ") << "live bytes " << before.liveBytes
                  << " -> " << now.liveBytes << " (" << LiveBlocks() << " blocks), open files "
                  << before.openFiles << " -> " << now.openFiles << ", threads " << before.threads
                  << " -> " << now.threads;
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
    const Records r = MakeRecords(2000, 4, 77);
    CallLog log(r);
    EXPECT_EQ(SortWith(log, MakeItSpill), Ending::Completed) << "a sort after the faults";
    EXPECT_TRUE(log.Complete()) << "a sort after the faults";
  }
  ExpectReleased(atStart_, "sort after the test", 0);
  DisarmAllocations();
  vexahost::SetReportSink(nullptr);
  SortTest::TearDown();
}

}  // namespace faults
