// VEXA_FileStream: buffered, positioned I/O on a file shared by copies.
//
// Each object is in one of three modes. Idle: no buffered bytes, the window
// is empty and the position is bufferPos_. Reading: buffer_ holds the file's
// bytes [bufferPos_, bufferPos_ + readEnd_ - buffer_) as read at write
// generation seenGeneration_; the codec may consume them through the window.
// Writing: buffer_[0, cursor_ - buffer_) are pending bytes for the file at
// bufferPos_; the codec may append up to writeEnd_. In every mode the
// position is bufferPos_ + (cursor_ - buffer_).
//
// An object in writing mode is listed in its file's `writers`, so that an
// object about to read from the file can first write the others' pending
// bytes: a copy sees everything written through another object without
// Flush(). Because the codec adds pending bytes without a call, membership
// follows the mode, not the count of pending bytes.
#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <limits>
#include <memory>
#include <new>

#include "host/hostsettings.h"
#include "hostinternal.h"
#include "isort/host/errhub.h"
#include "streamwindow.h"

namespace {

using W = VEXA_StreamWindow;
using SharedFile = VEXA_FileStream::SharedFile;
namespace sys = vexahost::sys;

[[noreturn]] void ThrowFileError(const char* operation, const std::string& name,
                                 const std::string& reason) {
  throw ErrorText(std::string(operation) + " of " + name + " failed: " + reason);
}

// Reads exactly `bytes` at `position`; retries partial transfers.
void ReadAll(SharedFile& file, unsigned char* to, std::size_t bytes, std::int64_t position) {
  while (bytes) {
    std::size_t moved = 0;
    int error = sys::ReadAt(file.handle, to, bytes, position, &moved);
    if (error) ThrowFileError("read", file.name, sys::ErrorString(error));
    if (moved == 0) ThrowFileError("read", file.name, "the file ended early");
    to += moved;
    bytes -= moved;
    position += static_cast<std::int64_t>(moved);
  }
}

// Writes exactly `bytes` at `position`; retries partial transfers. Needs the
// file's mutex.
void WriteAllLocked(SharedFile& file, const unsigned char* from, std::size_t bytes,
                    std::int64_t position) {
  const std::int64_t end = position + static_cast<std::int64_t>(bytes);
  while (bytes) {
    std::size_t moved = 0;
    int error = sys::WriteAt(file.handle, from, bytes, position, &moved);
    if (error) ThrowFileError("write", file.name, sys::ErrorString(error));
    if (moved == 0) ThrowFileError("write", file.name, "no bytes were written");
    from += moved;
    bytes -= moved;
    position += static_cast<std::int64_t>(moved);
  }
  file.size = std::max(file.size, end);
  ++file.generation;
}

void RemoveWriterLocked(SharedFile& file, const VEXA_FileStream* stream) {
  auto& writers = file.writers;
  auto it = std::find(writers.begin(), writers.end(), stream);
  if (it != writers.end()) {
    *it = writers.back();
    writers.pop_back();
  }
}

}  // namespace

// ---- helpers

void VEXA_StreamWindow::EnsureBuffer(const VEXA_FileStream& s) {
  if (s.buffer_) return;
  void* memory = std::malloc(s.bufferSize_);
  if (!memory) throw std::bad_alloc();
  auto& w = const_cast<VEXA_FileStream&>(s);
  // Without a buffer the object is idle and its window null.
  w.buffer_ = static_cast<unsigned char*>(memory);
  w.cursor_ = w.readEnd_ = w.writeEnd_ = w.buffer_;
}

void VEXA_StreamWindow::SetIdle(const VEXA_FileStream& s, std::int64_t position) {
  auto& w = const_cast<VEXA_FileStream&>(s);
  w.mode_ = kIdle;
  w.bufferPos_ = position;
  w.cursor_ = w.readEnd_ = w.writeEnd_ = w.buffer_;
}

void VEXA_StreamWindow::FlushLocked(const VEXA_FileStream& s) {
  if (s.mode_ != kWriting || s.cursor_ == s.buffer_) return;
  auto& w = const_cast<VEXA_FileStream&>(s);
  const std::size_t pending = static_cast<std::size_t>(s.cursor_ - s.buffer_);
  const std::int64_t at = s.bufferPos_;
  // The bytes leave the buffer whatever happens, so the position the caller
  // sees stays put; on failure they are lost and the stream is marked bad.
  w.bufferPos_ += static_cast<std::int64_t>(pending);
  w.cursor_ = w.buffer_;
  try {
    WriteAllLocked(*s.file_, s.buffer_, pending, at);
  } catch (...) {
    w.failed_ = true;
    throw;
  }
}

void VEXA_StreamWindow::FlushOthersLocked(const VEXA_FileStream& self) {
  auto& writers = self.file_->writers;
  for (std::size_t i = 0; i < writers.size();) {
    VEXA_FileStream* other = writers[i];
    if (other == &self || other->cursor_ == other->buffer_) {
      ++i;
      continue;
    }
    FlushLocked(*other);
    // The other object is left idle, so its next write (through a virtual
    // call, its window being empty) lists it again.
    SetIdle(*other, other->bufferPos_);
    writers[i] = writers.back();
    writers.pop_back();
  }
}

void VEXA_StreamWindow::ThrowLostWriteLocked(const SharedFile& file) {
  if (!file.lostWrite.empty()) throw ErrorText(file.lostWrite);
}

bool VEXA_StreamWindow::FreshLocked(const VEXA_FileStream& s) {
  FlushOthersLocked(s);
  return s.file_->generation == s.seenGeneration_;
}

bool VEXA_StreamWindow::Refill(VEXA_FileStream& s, std::int64_t position) {
  EnsureBuffer(s);
  SetIdle(s, position);
  SharedFile& file = *s.file_;
  std::int64_t size;
  std::uint64_t generation;
  {
    std::lock_guard<std::mutex> lock(file.mutex);
    ThrowLostWriteLocked(file);
    FlushOthersLocked(s);
    size = file.size;
    generation = file.generation;
  }
  std::size_t want = 0;
  if (position < size)
    want = static_cast<std::size_t>(std::min<std::int64_t>(s.bufferSize_, size - position));
  if (want) {
    try {
      ReadAll(file, s.buffer_, want, position);
    } catch (...) {
      s.failed_ = true;
      throw;
    }
  }
  s.mode_ = kReading;
  s.readEnd_ = s.buffer_ + want;
  s.seenGeneration_ = generation;
  return want != 0;
}

std::size_t VEXA_StreamWindow::ReadDirect(VEXA_FileStream& s, unsigned char* to,
                                          std::size_t bytes, std::int64_t position) {
  SharedFile& file = *s.file_;
  std::int64_t size;
  {
    std::lock_guard<std::mutex> lock(file.mutex);
    ThrowLostWriteLocked(file);
    FlushOthersLocked(s);
    size = file.size;
  }
  std::size_t want = 0;
  if (position < size) want = static_cast<std::size_t>(std::min<std::int64_t>(
                           static_cast<std::int64_t>(bytes), size - position));
  try {
    ReadAll(file, to, want, position);
  } catch (...) {
    s.failed_ = true;
    throw;
  }
  return want;
}

void VEXA_StreamWindow::WriteDirect(VEXA_FileStream& s, const unsigned char* from,
                                    std::size_t bytes) {
  SharedFile& file = *s.file_;
  const std::int64_t at = s.bufferPos_;
  s.bufferPos_ += static_cast<std::int64_t>(bytes);
  std::lock_guard<std::mutex> lock(file.mutex);
  try {
    WriteAllLocked(file, from, bytes, at);
  } catch (...) {
    s.failed_ = true;
    throw;
  }
}

void VEXA_StreamWindow::BeginWriting(VEXA_FileStream& s) {
  std::int64_t position = s.Tell();
  EnsureBuffer(s);
  SetIdle(s, position);
  SharedFile& file = *s.file_;
  {
    std::lock_guard<std::mutex> lock(file.mutex);
    if (file.append) {
      FlushOthersLocked(s);
      position = file.size;
    }
    file.writers.push_back(&s);
  }
  s.mode_ = kWriting;
  s.bufferPos_ = position;
  s.cursor_ = s.readEnd_ = s.buffer_;
  s.writeEnd_ = s.buffer_ + s.bufferSize_;
}

void VEXA_StreamWindow::EndWriting(const VEXA_FileStream& s) {
  if (s.mode_ != kWriting) return;
  SharedFile& file = *s.file_;
  std::lock_guard<std::mutex> lock(file.mutex);
  FlushLocked(s);
  RemoveWriterLocked(file, &s);
  SetIdle(s, s.Tell());
}

void VEXA_StreamWindow::Release(VEXA_FileStream& s, bool rethrow) {
  std::exception_ptr error;
  if (SharedFile* file = s.file_) {
    if (s.mode_ == kWriting) {
      std::lock_guard<std::mutex> lock(file->mutex);
      const bool shared = file->refs.load(std::memory_order_acquire) > 1;
      // Pending bytes of the last object of a file that goes away with it
      // have no reader: they are dropped unwritten.
      if (s.cursor_ != s.buffer_ && (shared || !file->removeWhenDone)) {
        try {
          FlushLocked(s);
        } catch (const ErrorText& e) {
          if (rethrow) {
            error = std::current_exception();
          } else if (shared) {
            try {
              if (file->lostWrite.empty()) file->lostWrite = e.text;
            } catch (...) {
              vexahost::internal::Report(e.text);
            }
          } else {
            vexahost::internal::Report(e.text);
          }
        } catch (...) {
          if (rethrow) error = std::current_exception();
        }
      }
      RemoveWriterLocked(*file, &s);
    }
    const std::int64_t position = s.Tell();
    s.file_ = nullptr;
    if (file->refs.fetch_sub(1, std::memory_order_acq_rel) == 1) delete file;
    std::free(s.buffer_);
    s.buffer_ = nullptr;
    SetIdle(s, position);
  } else {
    std::free(s.buffer_);
    s.buffer_ = nullptr;
    SetIdle(s, s.bufferPos_);
  }
  if (error) std::rethrow_exception(error);
}

// ---- VEXA_FileStream

VEXA_FileStream::VEXA_FileStream()
    : file_(nullptr),
      buffer_(nullptr),
      bufferSize_(vexahost::StreamBufferSize()),
      bufferPos_(0),
      mode_(W::kIdle),
      seenGeneration_(0) {}

// The copy starts at the original's position with a buffer of its own.
VEXA_FileStream::VEXA_FileStream(const VEXA_FileStream& other)
    : VEXA_StrBaseIO(other),
      file_(nullptr),
      buffer_(nullptr),
      bufferSize_(vexahost::StreamBufferSize()),
      bufferPos_(other.Tell()),
      mode_(W::kIdle),
      seenGeneration_(0) {
  if (other.file_) Attach(other.file_);
}

VEXA_FileStream::~VEXA_FileStream() { W::Release(*this, false); }

void VEXA_FileStream::Attach(SharedFile* file) {
  file_ = file;
  file->refs.fetch_add(1, std::memory_order_relaxed);
}

bool VEXA_FileStream::IsShared() const {
  return file_ && file_->refs.load(std::memory_order_acquire) > 1;
}

std::int64_t VEXA_FileStream::Tell() const { return bufferPos_ + (cursor_ - buffer_); }

unsigned int VEXA_FileStream::Read(void* buffer, unsigned int bytes) {
  if (!file_) {
    failed_ = true;
    return 0;
  }
  if (!file_->canRead) {
    failed_ = true;
    ThrowFileError("read", file_->name, sys::ErrorString(sys::NotPermittedError()));
  }
  if (mode_ == W::kWriting) W::EndWriting(*this);
  unsigned char* to = static_cast<unsigned char*>(buffer);
  unsigned int done = 0;
  while (done < bytes) {
    const unsigned int rest = bytes - done;
    if (std::size_t available = W::Readable(*this)) {
      const unsigned int n = available < rest ? static_cast<unsigned int>(available) : rest;
      std::memcpy(to + done, cursor_, n);
      cursor_ += n;
      done += n;
      continue;
    }
    const std::int64_t at = Tell();
    if (rest >= bufferSize_) {
      // Large transfers bypass the buffer.
      const std::size_t got = W::ReadDirect(*this, to + done, rest, at);
      W::SetIdle(*this, at + static_cast<std::int64_t>(got));
      done += static_cast<unsigned int>(got);
      if (got < rest) {
        atEnd_ = true;
        break;
      }
      continue;
    }
    if (!W::Refill(*this, at)) {
      atEnd_ = true;
      break;
    }
  }
  return done;
}

unsigned int VEXA_FileStream::Write(const void* buffer, unsigned int bytes) {
  if (!file_) {
    failed_ = true;
    return 0;
  }
  if (!file_->canWrite) {
    failed_ = true;
    ThrowFileError("write", file_->name, sys::ErrorString(sys::NotPermittedError()));
  }
  if (bytes == 0) return 0;
  if (mode_ != W::kWriting) W::BeginWriting(*this);
  const unsigned char* from = static_cast<const unsigned char*>(buffer);
  unsigned int done = 0;
  for (;;) {
    const unsigned int rest = bytes - done;
    const std::size_t room = W::Writable(*this);
    if (rest <= room) {
      std::memcpy(cursor_, from + done, rest);
      cursor_ += rest;
      return bytes;
    }
    if (cursor_ == buffer_) {
      // More than a whole buffer and nothing pending: bypass the buffer.
      W::WriteDirect(*this, from + done, rest);
      return bytes;
    }
    std::memcpy(cursor_, from + done, room);
    cursor_ += room;
    done += static_cast<unsigned int>(room);
    FlushBuffer();
  }
}

int VEXA_FileStream::Seek(std::int64_t position, SeekDirection from) {
  if (!file_) return 1;
  std::int64_t base;
  switch (from) {
    case SeekBegin:
      base = 0;
      break;
    case SeekCurrent:
      base = Tell();
      break;
    case SeekEnd: {
      FlushBuffer();
      std::lock_guard<std::mutex> lock(file_->mutex);
      W::FlushOthersLocked(*this);
      base = file_->size;
      break;
    }
    default:
      return 1;
  }
  if ((position > 0 && base > std::numeric_limits<std::int64_t>::max() - position) ||
      (position < 0 && base < std::numeric_limits<std::int64_t>::min() - position))
    return 1;
  const std::int64_t target = base + position;
  if (target < 0) return 1;
  atEnd_ = false;
  switch (mode_) {
    case W::kReading: {
      const std::int64_t valid = readEnd_ - buffer_;
      if (target >= bufferPos_ && target - bufferPos_ <= valid) {
        bool fresh = true;
        if (file_->refs.load(std::memory_order_acquire) > 1) {
          std::lock_guard<std::mutex> lock(file_->mutex);
          fresh = W::FreshLocked(*this);
        }
        if (fresh) {
          cursor_ = buffer_ + (target - bufferPos_);
          return 0;
        }
      }
      W::SetIdle(*this, target);
      return 0;
    }
    case W::kWriting:
      FlushBuffer();
      bufferPos_ = target;
      cursor_ = buffer_;
      return 0;
    default:
      W::SetIdle(*this, target);
      return 0;
  }
}

int VEXA_FileStream::Open(const char* name, const char* mode) {
  if (file_) W::Release(*this, true);
  Clear();
  W::SetIdle(*this, 0);
  const char kind = mode ? mode[0] : 0;
  if (!name || (kind != 'r' && kind != 'w' && kind != 'a')) {
    failed_ = true;
    return 1;
  }
  const bool plus = std::strchr(mode, '+') != nullptr;
  std::unique_ptr<SharedFile> file(new SharedFile);
  file->name = name;
  file->canRead = kind == 'r' || plus;
  file->canWrite = kind != 'r' || plus;
  file->append = kind == 'a';
  if (sys::OpenFile(file->name, file->canRead, file->canWrite, kind != 'r', kind == 'w',
                    &file->handle) != 0 ||
      sys::FileSize(file->handle, &file->size) != 0) {
    failed_ = true;
    return 1;
  }
  const std::int64_t start = file->append ? file->size : 0;
  Attach(file.release());
  W::SetIdle(*this, start);
  return 0;
}

int VEXA_FileStream::Close() const {
  FlushBuffer();
  return failed_ ? 1 : 0;
}

void VEXA_FileStream::FlushBuffer() const {
  if (mode_ != W::kWriting || cursor_ == buffer_) return;
  std::lock_guard<std::mutex> lock(file_->mutex);
  W::FlushLocked(*this);
}

void VEXA_FileStream::DropBuffer() const {
  if (mode_ == W::kWriting)
    W::EndWriting(*this);
  else if (mode_ == W::kReading)
    W::SetIdle(*this, Tell());
}
