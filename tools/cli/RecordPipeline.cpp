#include "RecordPipeline.h"

namespace isortcli {

RecordPipeline::RecordPipeline(unsigned nvars, Maker maker, unsigned chunkRecords, unsigned chunks)
    : nvars_(nvars), chunkRecords_(chunkRecords == 0 ? 1 : chunkRecords), maker_(std::move(maker)) {
  for (unsigned i = 0; i < (chunks < 2 ? 2 : chunks); ++i) {
    std::unique_ptr<Chunk> chunk(new Chunk);
    chunk->values.resize(std::size_t{nvars_} * chunkRecords_);
    chunk->firstSlot = std::size_t{i} * chunkRecords_;
    empty_.push_back(chunk.get());
    chunks_.push_back(std::move(chunk));
  }
}

RecordPipeline::~RecordPipeline() {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    stop_ = true;
  }
  freed_.notify_all();
  if (producer_.joinable()) producer_.join();
}

void RecordPipeline::InitBuffers(const std::function<void(OBS* record)>& init) {
  for (auto& chunk : chunks_) {
    for (unsigned i = 0; i < chunkRecords_; ++i) init(chunk->values.data() + std::size_t{nvars_} * i);
  }
}

const OBS* RecordPipeline::NextChunk() {
  if (finished_) return nullptr;
  if (!producer_.joinable()) producer_ = std::thread(&RecordPipeline::Produce, this);
  if (current_) {
    if (current_->last) {
      finished_ = true;
      if (current_->error) std::rethrow_exception(current_->error);
      return nullptr;
    }
    {
      std::lock_guard<std::mutex> lock(mutex_);
      empty_.push_back(current_);
    }
    freed_.notify_one();
    current_ = nullptr;
  }
  {
    std::unique_lock<std::mutex> lock(mutex_);
    filled_.wait(lock, [this] { return !full_.empty(); });
    current_ = full_.front();
    full_.pop_front();
  }
  next_ = 0;
  return Next();
}

void RecordPipeline::Produce() {
  for (;;) {
    Chunk* chunk;
    {
      std::unique_lock<std::mutex> lock(mutex_);
      freed_.wait(lock, [this] { return stop_ || !empty_.empty(); });
      if (stop_) return;
      chunk = empty_.front();
      empty_.pop_front();
    }
    chunk->count = 0;
    chunk->last = false;
    chunk->error = nullptr;
    try {
      while (chunk->count < chunkRecords_) {
        if (!maker_(chunk->values.data() + std::size_t{nvars_} * chunk->count, chunk->firstSlot + chunk->count)) {
          chunk->last = true;
          break;
        }
        ++chunk->count;
      }
    } catch (...) {
      chunk->error = std::current_exception();
      chunk->last = true;
    }
    const bool last = chunk->last;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      full_.push_back(chunk);
    }
    filled_.notify_one();
    if (last) return;
  }
}

}  // namespace isortcli
