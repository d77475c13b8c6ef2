// The output of a command: standard output, or a named file that appears
// under its name only once it is complete.
//
// A named regular file is written without a name (Linux O_TMPFILE, in the
// output's directory) and linked under its final name by Commit(); when it
// replaces an existing file it is linked to a hidden temporary name and
// renamed over it, so readers see the old file or the new one, never a part.
// Where O_TMPFILE is unavailable the file is written under a hidden temporary
// name (".NAME.XXXXXX") that the destructor removes on failure and that
// SIGINT, SIGTERM and SIGHUP handlers remove when the process is killed.
// A path that names an existing non-regular file (/dev/null, a pipe) is
// written directly. The new file takes the mode of the file it replaces.
//
// Without Commit() nothing appears: the destructor discards the file.
// Writes are buffered in large blocks, written by a thread of their own
// (BackgroundWriter.h) while the next block fills; the data is not forced
// to disk.
#pragma once

#include <cstddef>
#include <cstring>
#include <memory>
#include <string>

#include "BackgroundWriter.h"
#include "SysIo.h"

namespace isortcli {

class OutputFile {
 public:
  // `path` "-" or empty: standard output. Throws DataError when the file
  // cannot be created (the directory is missing or not writable).
  explicit OutputFile(const std::string& path, std::size_t bufferBytes = 2u << 20);
  ~OutputFile();
  OutputFile(const OutputFile&) = delete;
  OutputFile& operator=(const OutputFile&) = delete;

  void Write(const void* data, std::size_t bytes) {
    if (bytes > capacity_ - used_) {
      WriteSlow(data, bytes);
      return;
    }
    std::memcpy(buffer_.get() + used_, data, bytes);
    used_ += bytes;
  }
  // Writes what is buffered and gives the file its final name.
  void Commit();
  const std::string& Name() const { return displayName_; }

 private:
  void WriteSlow(const void* data, std::size_t bytes);
  void Flush();
  void Discard() noexcept;

  std::unique_ptr<char[]> buffer_;  // being filled
  std::unique_ptr<char[]> spare_;   // being written, or free
  std::size_t capacity_;
  std::size_t used_ = 0;
  FileHandle file_;
  std::unique_ptr<BackgroundWriter> writer_;  // declared after file_: stops before it closes
  std::string finalPath_;    // empty for standard output and direct writes
  std::string hiddenPath_;   // the fallback's temporary name, while it exists
  std::string displayName_;
  bool nameless_ = false;    // written through O_TMPFILE
  bool replaces_ = false;    // the final name existed when we started
  bool committed_ = false;
};

}  // namespace isortcli
