#include "BackgroundWriter.h"

namespace isortcli {

BackgroundWriter::~BackgroundWriter() {
  if (!thread_.joinable()) return;
  {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return !busy_; });
    stop_ = true;
  }
  changed_.notify_all();
  thread_.join();
}

void BackgroundWriter::Wait() {
  std::unique_lock<std::mutex> lock(mutex_);
  changed_.wait(lock, [this] { return !busy_; });
  if (error_) {
    std::exception_ptr error = error_;
    error_ = nullptr;
    std::rethrow_exception(error);
  }
}

void BackgroundWriter::Hand(const char* data, std::size_t bytes) {
  Wait();
  if (!thread_.joinable()) thread_ = std::thread(&BackgroundWriter::Run, this);
  {
    std::lock_guard<std::mutex> lock(mutex_);
    data_ = data;
    bytes_ = bytes;
    busy_ = true;
  }
  changed_.notify_all();
}

void BackgroundWriter::Run() {
  std::unique_lock<std::mutex> lock(mutex_);
  for (;;) {
    changed_.wait(lock, [this] { return stop_ || busy_; });
    if (stop_) return;
    const char* data = data_;
    const std::size_t bytes = bytes_;
    lock.unlock();
    std::exception_ptr error;
    try {
      file_.WriteAll(data, bytes);
    } catch (...) {
      error = std::current_exception();
    }
    lock.lock();
    error_ = error;
    busy_ = false;
    changed_.notify_all();
  }
}

}  // namespace isortcli
