// Thin, owning wrappers of the operating system's file calls: whole-block
// reads and writes that retry interrupted and short transfers, nameless
// temporary files, and the error texts that go into messages.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace isortcli {

// The system's text for an error number ("No space left on device").
std::string SystemErrorText(int error);

// An open file descriptor. Owns it unless it is a standard stream.
// Every failing call throws DataError naming the operation, the file's name
// as given at opening, and the system's reason.
class FileHandle {
 public:
  FileHandle() = default;
  FileHandle(int fd, std::string name, bool owned) : fd_(fd), name_(std::move(name)), owned_(owned) {}
  FileHandle(FileHandle&& other) noexcept { *this = std::move(other); }
  FileHandle& operator=(FileHandle&& other) noexcept;
  FileHandle(const FileHandle&) = delete;
  FileHandle& operator=(const FileHandle&) = delete;
  ~FileHandle() { Close(); }

  static FileHandle OpenRead(const std::string& path);
  static FileHandle StandardInput();
  static FileHandle StandardOutput();
  // A file in `directory` that has no name: nothing is left behind whatever
  // happens to the process (Linux O_TMPFILE; elsewhere created and unlinked
  // at once, or deleted on close on Windows). `purpose` goes into messages.
  static FileHandle CreateNameless(const std::string& directory, const std::string& purpose);

  bool IsOpen() const { return fd_ >= 0; }
  int Fd() const { return fd_; }
  const std::string& Name() const { return name_; }

  // Reads up to `bytes`; returns fewer only at the end of the file (0 there).
  std::size_t Read(void* buffer, std::size_t bytes);
  // Reads exactly `bytes` at `offset`.
  void ReadAt(void* buffer, std::size_t bytes, std::uint64_t offset);
  void WriteAll(const void* buffer, std::size_t bytes);
  // Moves the position to the start (for a second pass over a file).
  void Rewind();
  // The size of a regular file, or -1 for a pipe, terminal or device.
  std::int64_t RegularSize() const;
  void Close() noexcept;
  // Gives up ownership and returns the descriptor.
  int Release() noexcept {
    int fd = fd_;
    fd_ = -1;
    owned_ = false;
    return fd;
  }

 private:
  int fd_ = -1;
  std::string name_;
  bool owned_ = false;
};

// True when standard error is a terminal (the progress display's condition).
bool StandardErrorIsTerminal();

// The directory part of a path ("." when it has none).
std::string DirectoryOf(const std::string& path);

}  // namespace isortcli
