// Writes a file's buffers on a thread of its own, so that the thread that
// fills them (the sort's final merge, which runs alone) does not wait for
// the system's copy of every block.
//
// One write is in flight at a time: Hand() waits for the previous one, and
// the caller must not touch a buffer it handed over until the next Hand()
// or Wait() has returned. A failed write is rethrown (DataError) by the next
// Hand() or Wait().
#pragma once

#include <condition_variable>
#include <cstddef>
#include <exception>
#include <mutex>
#include <thread>

#include "SysIo.h"

namespace isortcli {

class BackgroundWriter {
 public:
  // `file` is not owned and must outlive the writer.
  explicit BackgroundWriter(FileHandle& file) : file_(file) {}
  // Waits for the write in flight; its failure is dropped.
  ~BackgroundWriter();
  BackgroundWriter(const BackgroundWriter&) = delete;
  BackgroundWriter& operator=(const BackgroundWriter&) = delete;

  void Hand(const char* data, std::size_t bytes);
  void Wait();

 private:
  void Run();

  FileHandle& file_;
  std::thread thread_;
  // Under mutex_.
  std::mutex mutex_;
  std::condition_variable changed_;
  const char* data_ = nullptr;  // the write in flight, if any
  std::size_t bytes_ = 0;
  bool busy_ = false;
  bool stop_ = false;
  std::exception_ptr error_;
};

}  // namespace isortcli
