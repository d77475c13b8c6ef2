// The workers: read a batch, sort it in memory, write it as a run or deliver it.
#include <cmath>
#include <memory>
#include <new>

#include "FileSortInternal.h"

namespace {

// A buffer of n values that needs no allocation when n is 0 or 1.
class ValueBuffer {
 public:
  explicit ValueBuffer(std::uint32_t n) {
    if (n > 1) heap_.reset(new OBS[CheckedBytes(n, sizeof(OBS)) / sizeof(OBS)]);
  }
  OBS* get() { return heap_ ? heap_.get() : &one_; }

 private:
  OBS one_ = 0;
  std::unique_ptr<OBS[]> heap_;
};

// How many records ahead the gather from the store asks for memory: enough
// to cover a memory access with the work of the records in between.
constexpr std::uint32_t kGatherAhead = 12;

ErrorText DamagedStore() {
  return ErrorText("the sort's in-memory record store is damaged: a record could not be decoded");
}

}  // namespace

FileSort::Sorter::Sorter(Data* problem) : data(problem), compare(problem->compare) {}

FileSort::Sorter::~Sorter() {
  if (runInfo.records != 0 && data->stats) {
    try {
      data->stats->runs.push_back(runInfo);
    } catch (const std::bad_alloc&) {
      data->RecordOutOfMemory();
    }
  }
  FreeBatch();
}

void FileSort::Sorter::FreeBatch() {
  delete[] entries;
  entries = nullptr;
  entriesAllocated = 0;
  delete store;
  store = nullptr;
}

bool FileSort::Sorter::GetWork() {
  if (data->Stopped()) return false;
  try {
    return ReadBatch();
  } catch (const std::bad_alloc&) {
    data->RecordOutOfMemory();
  } catch (const ErrorText& e) {
    data->RecordError(e);
  }
  return false;
}

void FileSort::Sorter::DoWork() {
  if (data->Stopped()) return;
  try {
    {
      PhaseTimer timer(nullptr, &runInfo.sortTime2);
      QuickSortEntries(entries, runInfo.records, data->layout.keyValues + 1, compare);
    }
    PhaseTimer timer(nullptr, &runInfo.writeTime2);
    if (singleRun) {
      Deliver();
    } else {
      WriteRun();
    }
  } catch (const std::bad_alloc&) {
    data->RecordOutOfMemory();
  } catch (const ErrorText& e) {
    data->RecordError(e);
  }
}

void FileSort::Sorter::Finish() {
  if (data->stats && workFile) data->stats->workFileBytes += workFile->Tell();
}

bool FileSort::Sorter::ReadBatch() {
  // The previous batch is done with; its buffers are reused below when they
  // are large enough, which spares the system a fresh zeroed page for every
  // byte of every batch.
  if (runInfo.records != 0 && data->stats) {
    const Statistics::RunInfo done = runInfo;
    runInfo.records = 0;
    data->stats->runs.push_back(done);
  }
  runInfo.records = runInfo.readTime2 = runInfo.sortTime2 = runInfo.writeTime2 = 0;
  if (data->inputExhausted) return false;

  PhaseTimer timer(nullptr, &runInfo.readTime2);
  if (!workFile) {
    std::unique_ptr<WorkFile> file(new WorkFile("sort"));
    data->workFiles.push_back(file.get());
    workFile = file.release();
  }

  const std::uint32_t K = data->layout.keyValues;
  const std::uint32_t R = data->layout.restValues;
  // Bytes per record in the store: the raw rest part before anything was
  // read, then the average compressed size seen so far over all batches.
  const bool first = data->recordsRead == 0.0;
  const std::uint32_t average =
      first ? 0u : static_cast<std::uint32_t>(
                       static_cast<std::uint64_t>(std::ceil(data->bytesStored / data->recordsRead)));
  const std::uint32_t estimate = first ? 8u * R : average;
  runInfo.memoryShare = data->memoryTarget / data->threads;
  const std::uint64_t perRecord = std::uint64_t{estimate} + 8ull * K + 8;
  std::uint64_t capacity = runInfo.memoryShare / perRecord;
  // A batch always takes at least one record, or the input would never be read.
  if (capacity == 0) capacity = 1;
  runInfo.capacity = static_cast<std::uint32_t>(capacity);

  const std::uint32_t width = K + 1;
  const std::size_t entryBytes = CheckedBytes(runInfo.capacity, std::uint64_t{width} * sizeof(OBS));
  if (runInfo.capacity > entriesAllocated) {
    delete[] entries;
    entries = nullptr;
    entriesAllocated = 0;
    entries = new OBS[entryBytes / sizeof(OBS)];
    entriesAllocated = runInfo.capacity;
  }
  const std::uint32_t storeEstimate = first ? (8u * R) / 3u : average;
  storeLimit = R == 0 ? 32u : runInfo.capacity * storeEstimate;
  // The batch stops once the store has reached its limit, so it never holds
  // more than the limit and one record: reserve that, and the store never
  // grows while it is filled. A store too small for this batch is replaced
  // rather than grown, which could briefly hold the old and the new block.
  const std::uint64_t storeBytes = std::uint64_t{storeLimit} + VEXA_CompressedBound(R);
  if (store && store->Capacity() < storeBytes) {
    delete store;
    store = nullptr;
  }
  if (!store) store = new BatchStore(static_cast<unsigned int>(CheckedBytes(storeBytes, 1)));
  store->Seek(0, VEXA_StrBaseIO::SeekBegin);
  ValueBuffer restBuffer(R);
  OBS* rest = restBuffer.get();

  runNumber = data->runCounter++;
  OBS* entry = entries;
  while (runInfo.records < runInfo.capacity) {
    if (R > 0 && store->Tell() >= storeLimit) break;
    const OBS* record = data->owner->GetRecord();
    if (!record) {
      data->inputExhausted = true;
      singleRun = runNumber == 0;
      break;
    }
    data->layout.Split(record, entry, rest);
    SetTag(entry + K, R > 0 ? static_cast<std::uint32_t>(store->Tell()) : runInfo.records);
    if (R > 0) WriteCompressed(*store, rest, R);
    ++runInfo.records;
    entry += width;
  }

  data->recordsRead += runInfo.records;
  data->bytesStored += static_cast<double>(store->Tell());
  if (data->stats) {
    data->stats->records += runInfo.records;
    data->stats->recordBytes = (K + R) * 8;
  }
  run = nullptr;
  if (runInfo.records != 0 && !singleRun) {
    const std::int64_t position = workFile->Tell();
    data->runs.emplace_front(position, position, workFile, false);
    run = &data->runs.front();
  }
  return runInfo.records != 0;
}

void FileSort::Sorter::WriteRun() {
  const std::uint32_t K = data->layout.keyValues;
  const std::uint32_t R = data->layout.restValues;
  // The run tag: run number - 99, so that run numbers up to 250 take one
  // code byte in the compressed form.
  const double runTag = static_cast<double>(runNumber) - 99.0;
  if (R > 0) store->PrepareGather();
  OBS* entry = entries;
  for (std::uint32_t i = 0; i < runInfo.records; ++i, entry += K + 1) {
    if (R > 0 && i + kGatherAhead < runInfo.records) {
      store->Prefetch(TagLowWord(entry + kGatherAhead * (K + 1) + K));
    }
    const std::uint32_t position = TagLowWord(entry + K);
    std::memcpy(entry + K, &runTag, sizeof runTag);
    WriteCompressed(*workFile, entry, K + 1);
    if (R > 0) {
      store->Seek(position, VEXA_StrBaseIO::SeekBegin);
      if (!CopyPrecompressed(*store, *workFile, R)) throw DamagedStore();
    }
  }
  // The run's end is read once it is complete: nothing reads a run whose
  // writing failed, since the merge does not run after a failure.
  run->end = workFile->Tell();
}

void FileSort::Sorter::Deliver() {
  const std::uint32_t K = data->layout.keyValues;
  const std::uint32_t R = data->layout.restValues;
  ValueBuffer output(data->nvars);
  ValueBuffer restBuffer(R);
  OBS* record = output.get();
  OBS* rest = restBuffer.get();
  if (R > 0) store->PrepareGather();
  const OBS* entry = entries;
  for (std::uint32_t i = 0; i < runInfo.records; ++i, entry += K + 1) {
    if (R > 0 && i + kGatherAhead < runInfo.records) {
      store->Prefetch(TagLowWord(entry + kGatherAhead * (K + 1) + K));
    }
    if (R > 0) {
      store->Seek(TagLowWord(entry + K), VEXA_StrBaseIO::SeekBegin);
      if (!ReadCompressed(*store, rest, R)) throw DamagedStore();
    }
    data->layout.Join(entry, rest, record);
    data->owner->PutRecord(record);
  }
}
