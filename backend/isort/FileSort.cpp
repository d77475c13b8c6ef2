// The sort's front: construction, planning, and Sort() with its failure transport.
#include <memory>
#include <new>
#include <string>

#include "FileSortInternal.h"
#include "isort/host/vexawlib.h"

namespace {

// A key must lie inside the record; otherwise Split and Join would run off it.
void CheckKeys(const std::vector<FileSort::SortKey>& keys, std::uint32_t nvars) {
  for (std::size_t i = 0; i < keys.size(); ++i) {
    const FileSort::SortKey& key = keys[i];
    const std::uint64_t step = KeyStep(key.width);
    if (key.variable < 0 || static_cast<std::uint64_t>(key.variable) + step > nvars) {
      throw ErrorText("sort key " + std::to_string(i + 1) + " (variable " +
                      std::to_string(key.variable) + ", width " + std::to_string(key.width) +
                      ") lies outside the record of " + std::to_string(nvars) + " values");
    }
  }
}

}  // namespace

std::size_t CheckedBytes(std::uint64_t count, std::uint64_t size) {
  if (size != 0 && count > 0xFFFFFFFFull / size) throw std::bad_alloc();
  return static_cast<std::size_t>(count * size);
}

PhaseTimer::PhaseTimer(std::uint32_t* firstOut, std::uint32_t* secondOut)
    : start1_(0), start2_(0), out1_(firstOut), out2_(secondOut) {
  TIMTOT(&start1_, &start2_);
}

PhaseTimer::~PhaseTimer() {
  FortranInt now1 = 0, now2 = 0;
  TIMTOT(&now1, &now2);
  if (out1_) *out1_ = static_cast<std::uint32_t>(now1) - static_cast<std::uint32_t>(start1_);
  if (out2_) *out2_ = static_cast<std::uint32_t>(now2) - static_cast<std::uint32_t>(start2_);
}

unsigned int ChooseThreads(std::int64_t nrows, unsigned int nvars, unsigned int memoryTarget) {
  const unsigned int setting = GETTHREADS();
  const unsigned int packages = getPhysicalCPUCount();
  const unsigned int cores = getCoresPerPhysicalCPUCount();
  unsigned int t = packages * cores;
  if (setting < t) t = setting;
  if (t < 2) t = 2;
  if (nrows < 0) return t;
  // One value per variable and one for the entry tag, per record.
  const std::uint64_t perRecord = static_cast<std::uint64_t>(nvars + 1u) * 8;
  const std::uint64_t rows = static_cast<std::uint64_t>(nrows);
  if (perRecord != 0 && rows > UINT64_MAX / perRecord) return t;
  return rows * perRecord < memoryTarget ? 1 : t;
}

FileSort::Data::Data(const std::vector<SortKey>& keys, std::uint32_t n, FileSort* o,
                     Statistics* s)
    : nvars(n),
      owner(o),
      layout((CheckKeys(keys, n), keys), n),
      compare(keys),
      memoryTarget(kMinimumMemoryTarget),
      stats(s) {}

FileSort::Data::~Data() {
  for (WorkFile* file : workFiles) delete file;
}

ptask::ProblemPartBase* FileSort::Data::CreatePart() { return new Sorter(this); }

void FileSort::Data::RecordError(const ErrorText& e) {
  std::lock_guard<std::mutex> lock(errorMutex);
  try {
    error = e;
  } catch (const std::bad_alloc&) {
    // Could not keep the text: report the failure as what it now is.
    outOfMemory.store(true);
  }
  failed.store(true);
}

FileSort::FileSort(const std::vector<SortKey>& keys, unsigned int nvars, Statistics* stats)
    : data(new Data(keys, nvars, this, stats)) {}

FileSort::~FileSort() { delete data; }

void FileSort::SetMemoryTarget(unsigned int bytes) {
  data->memoryTarget = bytes < kMinimumMemoryTarget ? kMinimumMemoryTarget : bytes;
}

void FileSort::SetNRows(std::int64_t rows) { data->nrows = rows; }

void FileSort::Sort() {
  Data& d = *data;
  if (d.failure) std::rethrow_exception(d.failure);
  try {
    d.threads = ChooseThreads(d.nrows, d.nvars, d.memoryTarget);
    std::uint32_t time1 = 0, time2 = 0;
    {
      PhaseTimer timer(&time1, &time2);
      ptask::Driver(&d, static_cast<int>(d.threads));
    }
    if (!d.Stopped()) {
      if (d.stats) {
        d.stats->threads = d.threads;
        d.stats->runPhaseTime2 = time2;
        d.stats->runPhaseTime1 = time1;
      }
      d.Merge();
    }
    if (d.outOfMemory.load()) throw std::bad_alloc();
    if (d.failed.load()) {
      std::lock_guard<std::mutex> lock(d.errorMutex);
      throw ErrorText(d.error);
    }
  } catch (...) {
    d.failure = std::current_exception();
    throw;
  }
}
