// Makes sort records ahead of the sort, on a thread of its own.
//
// The sort library reads its input one record at a time under one lock, so
// the time spent making a record (parsing a row, converting its keys) is
// time no worker can read. A pipeline moves that work to a producer thread
// that fills chunks of records while the workers sort; GetRecord() then only
// hands out the next record of a filled chunk.
//
// The producer calls the maker in input order; the consumer (Next()) must
// not be called from two threads at once. An exception thrown by the maker
// is rethrown by Next() at the place in the input where it happened.
#pragma once

#include <condition_variable>
#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "isort/host/vexatypes.h"

namespace isortcli {

class RecordPipeline {
 public:
  // Writes the next record into `record` (nvars values) and returns true, or
  // returns false at the end of the input. `slot` numbers the buffer that
  // `record` is, so the maker may keep state per buffer (each buffer is
  // reused for later records).
  typedef std::function<bool(OBS* record, std::size_t slot)> Maker;

  RecordPipeline(unsigned nvars, Maker maker, unsigned chunkRecords = 2048, unsigned chunks = 4);
  ~RecordPipeline();
  RecordPipeline(const RecordPipeline&) = delete;
  RecordPipeline& operator=(const RecordPipeline&) = delete;

  // The next record, valid until the next call; null at the end.
  const OBS* Next() {
    if (current_ && next_ < current_->count) return current_->values.data() + std::size_t{nvars_} * next_++;
    return NextChunk();
  }
  // Slots the maker will see: 0 .. Slots() - 1.
  std::size_t Slots() const { return std::size_t{chunkRecords_} * chunks_.size(); }
  // Applies `init` to every record buffer before the producer starts.
  void InitBuffers(const std::function<void(OBS* record)>& init);

 private:
  struct Chunk {
    std::vector<OBS> values;
    std::size_t firstSlot = 0;
    unsigned count = 0;
    bool last = false;
    std::exception_ptr error;
  };
  const OBS* NextChunk();
  void Produce();

  const unsigned nvars_;
  const unsigned chunkRecords_;
  Maker maker_;
  std::vector<std::unique_ptr<Chunk>> chunks_;

  // Shared between the threads, under mutex_.
  std::mutex mutex_;
  std::condition_variable filled_;  // a chunk was filled
  std::condition_variable freed_;   // a chunk was freed, or stop_ set
  std::deque<Chunk*> full_;
  std::deque<Chunk*> empty_;
  bool stop_ = false;

  // The consumer's own.
  Chunk* current_ = nullptr;
  unsigned next_ = 0;
  bool finished_ = false;
  std::thread producer_;
};

}  // namespace isortcli
