// The sort's internal types, shared by its source files and its tests.
//
// A record splits into its key part (the keys' values in key order, K values)
// and its rest part (the values no key covers, R values). A sort entry is the
// key part followed by an 8-byte tag whose low 32-bit word breaks ties: while
// a batch is in memory it is the record's position in the batch's store (or
// its ordinal when R is 0), after a run is read back it is the run's number.
// Both grow in input order, which is what makes the sort stable.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <deque>
#include <exception>
#include <mutex>
#include <vector>

#include "FileSort.h"
#include "isort/host/errhub.h"
#include "isort/host/hostsys.h"
#include "isort/host/iostore.h"
#include "isort/host/ptask.h"

// Reads the low 32-bit word of an entry tag.
inline std::uint32_t TagLowWord(const OBS* tag) {
  std::uint32_t low;
  std::memcpy(&low, tag, sizeof low);  // little-endian: the low word comes first
  return low;
}
inline void SetTag(OBS* tag, std::uint32_t low) {
  const std::uint64_t bits = low;
  std::memcpy(tag, &bits, sizeof bits);
}

// Values a key spans: 1 up to 8 bytes (numeric keys too), else width / 8 rounded up.
inline std::uint32_t KeyStep(std::uint32_t width) {
  return width <= 8 ? 1u : static_cast<std::uint32_t>((std::uint64_t{width} + 7) / 8);
}

// Throws std::bad_alloc unless count * size bytes fit in 32 bits.
std::size_t CheckedBytes(std::uint64_t count, std::uint64_t size);

// Where each value of a record goes in the key part and the rest part.
// Immutable once built; Split and Join may run on any number of threads.
class FileSort::KeyLayout {
 public:
  struct Segment {
    std::uint32_t first;  // index of the first value in the record
    std::uint32_t count;  // number of values
  };

  // Every key contributes its own segment, in key order, even when it
  // overlaps or repeats another key's values: the key part then holds those
  // values twice, which keeps it in line with the comparison, which takes
  // one field per key. The rest part holds exactly the values no key covers.
  // REQUIRES: every key lies inside the record (the caller checks).
  KeyLayout(const std::vector<SortKey>& keys, std::uint32_t nvars);

  // Copies the key segments' values to keyPart (K values) and the rest
  // segments' values to restPart (R values), 8 bytes each, uninterpreted.
  void Split(const OBS* record, OBS* keyPart, OBS* restPart) const;
  // The inverse: writes every value of `record` (values covered by several
  // keys more than once, with the same bits).
  void Join(const OBS* keyPart, const OBS* restPart, OBS* record) const;

  std::uint32_t keyValues = 0;   // K
  std::uint32_t restValues = 0;  // R
  std::vector<Segment> keySegments;
  std::vector<Segment> restSegments;
};

// The comparison context: a collator and the keys. The problem holds one;
// each worker holds a copy, so no collator is used by two threads at once.
class FileSort::KeyCompare {
 public:
  explicit KeyCompare(const std::vector<SortKey>& keys);  // default collator, then Init()
  KeyCompare(const KeyCompare& other);                     // copies the collator; no Init()
  KeyCompare& operator=(const KeyCompare&) = delete;

  // Orders two sort entries (K key values, then the tag): negative when `a`
  // sorts first, positive when `b` does, 0 only for equal keys and equal tag
  // low words. Only the sign means anything. A NaN compares equal to every
  // value; +0.0 equals -0.0. Among equal keys the smaller tag comes first,
  // whatever the directions; tags compare as unsigned 32-bit numbers.
  int Compare(const OBS* a, const OBS* b) const {
    for (const SortKey& key : keys) {
      int r;
      std::uint32_t step = 1;
      if (key.width != 0) {
        r = collator.Compare(reinterpret_cast<const char*>(a), key.width,
                             reinterpret_cast<const char*>(b), key.width);
        step = KeyStep(key.width);
      } else {
        double x, y;
        std::memcpy(&x, a, sizeof x);
        std::memcpy(&y, b, sizeof y);
        // Branch-free: in a sort the outcome is a coin toss for the predictor.
        r = static_cast<int>(x > y) - static_cast<int>(x < y);
      }
      // 32-bit wrapping product: a collator may return any int.
      r = static_cast<int>(static_cast<std::uint32_t>(r) * static_cast<std::uint32_t>(key.direction));
      a += step;
      b += step;
      if (r != 0) return r;
    }
    const std::uint32_t ta = TagLowWord(a), tb = TagLowWord(b);
    return static_cast<int>(ta > tb) - static_cast<int>(ta < tb);
  }

  VEXAMBCollator collator;
  std::vector<SortKey> keys;
};

// Scoped pair of TIMTOT readings; on destruction stores the differences of
// the first and second readings through the pointers that are not null.
class PhaseTimer {
 public:
  PhaseTimer(std::uint32_t* firstOut, std::uint32_t* secondOut);
  ~PhaseTimer();
  PhaseTimer(const PhaseTimer&) = delete;
  PhaseTimer& operator=(const PhaseTimer&) = delete;

 private:
  FortranInt start1_;
  FortranInt start2_;
  std::uint32_t* out1_;
  std::uint32_t* out2_;
};

// Worker threads for a sort: the machine's cores capped by the host's thread
// setting, at least 2; 1 when the announced rows fit in the memory target.
unsigned int ChooseThreads(std::int64_t nrows, unsigned int nvars, unsigned int memoryTarget);

// Exchanges two entries of `width` values.
void SwapEntries(OBS* x, OBS* y, unsigned int width);
// The one of a, b, c whose entry lies between the other two.
OBS* MedianOfThree(OBS* a, OBS* b, OBS* c, const FileSort::KeyCompare& compare);
// Sorts `count` entries of `width` values in place into ascending Compare()
// order. Allocates nothing; recursion depth is logarithmic in `count`.
void QuickSortEntries(OBS* entries, unsigned int count, unsigned int width,
                      const FileSort::KeyCompare& compare);

// A temporary file holding runs: a worker's ("sort") or a merge pass's ("merge").
class FileSort::WorkFile : public VEXA_TempFile {
 public:
  explicit WorkFile(const char* prefix) : VEXA_TempFile(prefix, true) {}
  WorkFile(const WorkFile& other) : VEXA_TempFile(other) {}
  ~WorkFile() override {}
};

// A sorted run: the bytes [start, end) of `stream`, records back to back,
// each its sort entry (K + 1 values, the tag being run number - 99) and its
// rest part (R values), both compressed.
struct RunDescriptor {
  RunDescriptor(std::int64_t s, std::int64_t e, VEXA_StrBaseIO* st, bool owns)
      : start(s), end(e), stream(st), ownsStream(owns) {}
  ~RunDescriptor() {
    if (ownsStream) delete stream;
  }
  RunDescriptor(const RunDescriptor&) = delete;
  RunDescriptor& operator=(const RunDescriptor&) = delete;

  std::int64_t start;
  std::int64_t end;
  VEXA_StrBaseIO* stream;  // always a FileSort::WorkFile; owned only when ownsStream
  bool ownsStream;
};

// Reads one run back record by record through its own copy of the file.
// States: made from a descriptor -> Open() (own stream copy at `start`) ->
// Allocate() (buffers) -> ReadNext() until false. The merge reads `entry`
// and `rest` directly and may overwrite the tag before the next ReadNext().
class RunReader {
 public:
  explicit RunReader(const RunDescriptor& run);
  ~RunReader();
  RunReader(const RunReader&) = delete;
  RunReader& operator=(const RunReader&) = delete;

  void Allocate(unsigned int K, unsigned int R);  // std::bad_alloc
  void Open();
  // Reads the next record into the buffers, the run number in the tag's low
  // word; false at the end of the run. Throws ErrorText on a damaged run.
  bool ReadNext();
  bool ReadRest(OBS* buffer, long count);

  std::int64_t start;
  std::int64_t end;
  VEXA_StrBaseIO* stream;  // the descriptor's object until Open(), then our own copy
  bool ownsStream;
  std::uint32_t K = 0;
  std::uint32_t R = 0;
  OBS* entry = nullptr;  // K + 1 values; owned
  OBS* rest = nullptr;   // R values, null when R is 0; owned
};

// The problem object: shared state of one sort. Fields are read and written
// without locks, relying on the driver's order of calls (GetWork, Finish and
// the workers' destructors never overlap), except the failure transport:
// `outOfMemory` and `failed` are atomic and `error` is copied under
// `errorMutex`, since two workers may fail at the same moment.
class FileSort::Data : public ptask::ProblemBase {
 public:
  Data(const std::vector<SortKey>& keys, std::uint32_t nvars, FileSort* owner, Statistics* stats);
  ~Data() override;

  ptask::ProblemPartBase* CreatePart() override;

  // Merges the run list in passes and delivers every record (caller's thread).
  void Merge();
  // Runs the next pass takes: all when they fit, else as many as the memory
  // target allows. 64-bit sums.
  unsigned int ChooseFanIn(unsigned int memoryTarget, const WorkFile& mergeFile) const;
  // Moves up to k runs from the front of the run list into opened readers.
  void TakeRuns(unsigned int k, std::deque<RunReader>& readers);
  // Destroys the work-file objects that readers have copied and that no run
  // still waiting in the list refers to.
  void ReleaseSharedFiles();
  // Merges `readers`: into `output` when runs remain in the list, else to
  // PutRecord().
  void MergePass(std::deque<RunReader>& readers, RunDescriptor& output);

  // Records a failure caught on a worker; safe from any thread.
  void RecordOutOfMemory() { outOfMemory.store(true); }
  void RecordError(const ErrorText& e);
  bool Stopped() const { return outOfMemory.load() || failed.load(); }

  std::uint32_t nvars;
  FileSort* owner;                  // not owned
  std::vector<WorkFile*> workFiles;  // owned
  std::deque<RunDescriptor> runs;   // newest part-written run first
  KeyLayout layout;
  KeyCompare compare;
  std::uint32_t runCounter = 0;
  bool inputExhausted = false;
  double recordsRead = 0.0;
  double bytesStored = 0.0;
  std::uint32_t memoryTarget;
  std::uint32_t threads = 1;
  std::int64_t nrows = -1;
  Statistics* stats;  // may be null; not owned
  ErrorText error;
  std::atomic<bool> outOfMemory{false};
  std::atomic<bool> failed{false};
  std::mutex errorMutex;
  // The failure that ended an earlier Sort(), of any kind: a sort that
  // failed fails again the same way rather than deliver what is left.
  std::exception_ptr failure;
};

constexpr std::uint32_t kMinimumMemoryTarget = 104857600;  // 100 MiB

// A batch's in-memory record store. It is written in input order and read
// back in key order, one record at a time, nearly every record a cache miss:
// the batch knows which records come next, so it tells the memory system.
class BatchStore : public VEXA_InMemoryFile {
 public:
  explicit BatchStore(unsigned int initialSize) : VEXA_InMemoryFile(initialSize) {}

  // Readies Prefetch() for a gather: after a seek to 0 the stream's window
  // shows the whole store as one block. Leaves the position at 0.
  void PrepareGather() {
    Seek(0, SeekBegin);
    block_ = cursor_;
    blockBytes_ = readEnd_ > cursor_ ? static_cast<std::size_t>(readEnd_ - cursor_) : 0;
  }
  // Starts the record at `position` on its way into the cache; a hint only.
  void Prefetch(std::uint32_t position) const {
    if (position < blockBytes_) {
      const unsigned char* p = block_ + position;
      __builtin_prefetch(p);
      __builtin_prefetch(p + 64);
    }
  }

 private:
  const unsigned char* block_ = nullptr;
  std::size_t blockBytes_ = 0;
};

// One worker of the sort: reads a batch, sorts it, writes it as a run (or
// delivers it when it is the whole input). Owned by the driver.
class FileSort::Sorter : public ptask::ProblemPartBase {
 public:
  explicit Sorter(Data* problem);
  ~Sorter() override;
  bool GetWork() override;
  void DoWork() override;
  void Finish() override;

  std::uint32_t storeLimit = 0;
  Data* data;                         // not owned
  OBS* entries = nullptr;             // entriesAllocated * (K + 1) values; owned
  std::uint32_t entriesAllocated = 0;  // batches reuse the buffer while it is large enough
  std::uint32_t runNumber = 0;
  BatchStore* store = nullptr;  // the batch's compressed rest parts; owned
  bool singleRun = false;
  WorkFile* workFile = nullptr;  // owned by data->workFiles
  RunDescriptor* run = nullptr;  // this batch's run in data->runs, or null
  Statistics::RunInfo runInfo{};
  KeyCompare compare;

 private:
  bool ReadBatch();
  void SortBatch();
  void WriteRun();
  void Deliver();
  void FreeBatch();
};

// Internal and test access to a FileSort's problem object.
struct FileSortAccess {
  static FileSort::Data& DataOf(FileSort& sort) { return *sort.data; }
};
