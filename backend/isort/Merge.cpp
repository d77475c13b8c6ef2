// Merging the runs in passes bounded by the memory target, and delivery.
#include <algorithm>
#include <memory>

#include "FileSortInternal.h"

namespace {

struct HeapItem {
  RunReader* reader;
  const FileSort::KeyCompare* compare;
};

// Orders the heap so that its top is the reader whose current entry sorts first.
bool HeapOrder(const HeapItem& x, const HeapItem& y) {
  return x.compare->Compare(x.reader->entry, y.reader->entry) > 0;
}

std::uint64_t FootprintOf(const RunDescriptor& run) {
  return static_cast<const FileSort::WorkFile*>(run.stream)->Footprint();
}

}  // namespace

unsigned int FileSort::Data::ChooseFanIn(unsigned int M, const WorkFile& mergeFile) const {
  const std::uint64_t F = mergeFile.Footprint();
  const std::size_t n = runs.size();
  // Do all runs fit into one final pass (with two merge-file footprints spare)?
  std::uint64_t total = 2 * F;
  std::size_t c = 0;
  for (auto it = runs.rbegin(); it != runs.rend(); ++it) {
    total += FootprintOf(*it);
    if (total > M) break;
    ++c;
  }
  if (c == n) return static_cast<unsigned int>(n);
  // No: take what fits beside one merge file, but no more than leaves the
  // rest for one final pass.
  total = F;
  const std::size_t limit = n - c + 2;
  std::size_t m = 0;
  while (m < limit && m < n) {
    total += FootprintOf(runs[m]);
    if (total > M) break;
    ++m;
  }
  return static_cast<unsigned int>(m);
}

void FileSort::Data::TakeRuns(unsigned int k, std::deque<RunReader>& readers) {
  while (!runs.empty() && readers.size() < k) {
    readers.emplace_back(runs.front());
    readers.back().Open();  // its own copy, before the descriptor goes
    runs.pop_front();
  }
}

void FileSort::Data::Merge() {
  if (runs.empty()) return;
  for (;;) {
    std::uint32_t time1 = 0, time2 = 0;
    std::deque<RunReader> readers;
    bool final;
    {
      PhaseTimer timer(&time1, &time2);
      std::unique_ptr<WorkFile> mergeFile(new WorkFile("merge"));
      RunDescriptor output(mergeFile->Tell(), mergeFile->Tell(), mergeFile.get(), false);
      // Every pass takes at least two runs, so the list always shrinks.
      const unsigned int k = std::max(ChooseFanIn(memoryTarget, *mergeFile), 2u);
      TakeRuns(k, readers);
      ReleaseSharedFiles();
      MergePass(readers, output);
      final = runs.empty();
      if (!final) {
        workFiles.reserve(workFiles.size() + 1);  // the push below cannot fail then
        runs.emplace_back(output.start, output.end, mergeFile.get(), false);
        workFiles.push_back(mergeFile.release());
      }
    }
    if (stats) {
      const std::uint64_t bytes = final ? 0 : static_cast<std::uint64_t>(runs.back().end - runs.back().start);
      stats->merges.push_back({bytes, static_cast<std::uint32_t>(readers.size()), time2, time1});
    }
    if (final) return;
  }
}

void FileSort::Data::MergePass(std::deque<RunReader>& readers, RunDescriptor& output) {
  const bool final = runs.empty();
  const std::uint32_t K = layout.keyValues;
  const std::uint32_t R = layout.restValues;

  std::vector<HeapItem> heap;
  heap.reserve(readers.size());
  for (RunReader& reader : readers) {
    reader.Allocate(K, R);
    if (reader.ReadNext()) {
      heap.push_back({&reader, &compare});
      std::push_heap(heap.begin(), heap.end(), HeapOrder);
    }
  }

  // The output record: one value inside this frame when nvars is 0 or 1.
  OBS one = 0;
  std::unique_ptr<OBS[]> many;
  OBS* record = &one;
  if (final && nvars > 1) {
    many.reset(new OBS[CheckedBytes(nvars, sizeof(OBS)) / sizeof(OBS)]);
    record = many.get();
  }

  while (!heap.empty()) {
    RunReader* top = heap.front().reader;
    std::pop_heap(heap.begin(), heap.end(), HeapOrder);
    heap.pop_back();
    if (final) {
      layout.Join(top->entry, top->rest, record);
      owner->PutRecord(record);
    } else {
      const double tag = static_cast<double>(TagLowWord(top->entry + K)) - 99.0;
      std::memcpy(top->entry + K, &tag, sizeof tag);
      WriteCompressed(*output.stream, top->entry, static_cast<long>(K) + 1);
      if (R != 0) WriteCompressed(*output.stream, top->rest, R);
    }
    if (top->ReadNext()) {
      heap.push_back({top, &compare});
      std::push_heap(heap.begin(), heap.end(), HeapOrder);
    }
  }
  // A pass that fails never hands its run on, so the end is needed only now.
  if (!final) output.end = output.stream->Tell();
}
