// Internal: the host's own access to the streams' protected state.
//
// VEXA_StreamWindow is the friend that iostore.h names. The record codec uses
// the window accessors to encode and decode straight in an object's buffer;
// the file-stream helpers keep the state of objects that share one open file
// consistent (buffers, modes, pending writes).
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "isort/host/iostore.h"
#include "sysfile.h"

// What copies of one file stream share. Fields marked "guarded" are touched
// only with `mutex` held.
struct VEXA_FileStream::SharedFile {
  SharedFile() = default;
  SharedFile(const SharedFile&) = delete;
  SharedFile& operator=(const SharedFile&) = delete;
  ~SharedFile() {
    if (handle != vexahost::sys::NoHandle()) vexahost::sys::Close(handle);
  }

  vexahost::sys::Handle handle = vexahost::sys::NoHandle();
  std::string name;
  bool removeWhenDone = false;
  bool canRead = true;
  bool canWrite = true;
  bool append = false;
  std::atomic<int> refs{0};  // objects attached

  std::mutex mutex;
  std::int64_t size = 0;         // guarded: highest byte written, or the size found at open
  std::uint64_t generation = 0;  // guarded: counts writes that reached the file
  // guarded: objects in writing mode; only they can hold pending bytes.
  std::vector<VEXA_FileStream*> writers;
  // guarded: a write that failed where it could not be thrown (an object
  // destroyed with pending bytes); later reads through the others throw it.
  std::string lostWrite;
};

struct VEXA_StreamWindow {
  // ---- the window, for the codec
  static unsigned char* Cursor(const VEXA_StrBaseIO& s) { return s.cursor_; }
  static void Advance(VEXA_StrBaseIO& s, unsigned char* to) { s.cursor_ = to; }
  static std::size_t Readable(const VEXA_StrBaseIO& s) {
    return s.readEnd_ > s.cursor_ ? static_cast<std::size_t>(s.readEnd_ - s.cursor_) : 0;
  }
  static std::size_t Writable(const VEXA_StrBaseIO& s) {
    return s.writeEnd_ > s.cursor_ ? static_cast<std::size_t>(s.writeEnd_ - s.cursor_) : 0;
  }

  // ---- file streams (filestream.cpp)
  enum Mode { kIdle = 0, kReading = 1, kWriting = 2 };

  // Gives up the object's hold on its file: pending bytes are written unless
  // nobody could read them any more, the file is closed with its last object,
  // and the buffer is freed. With `rethrow` a failed write is thrown after
  // the release; otherwise it is kept for the other objects or reported.
  static void Release(VEXA_FileStream& s, bool rethrow);

  // Helpers of the file-stream operations. "Locked" ones need the file's
  // mutex held. Those that take a const object change it only when it holds
  // a buffer or pending bytes, which a const-defined object never does.
  using SharedFile = VEXA_FileStream::SharedFile;
  static void EnsureBuffer(const VEXA_FileStream& s);
  static void SetIdle(const VEXA_FileStream& s, std::int64_t position);
  static void FlushLocked(const VEXA_FileStream& s);
  static void FlushOthersLocked(const VEXA_FileStream& self);
  static void ThrowLostWriteLocked(const SharedFile& file);
  static bool Refill(VEXA_FileStream& s, std::int64_t position);
  static std::size_t ReadDirect(VEXA_FileStream& s, unsigned char* to, std::size_t bytes,
                                std::int64_t position);
  static void WriteDirect(VEXA_FileStream& s, const unsigned char* from, std::size_t bytes);
  static void BeginWriting(VEXA_FileStream& s);
  static void EndWriting(const VEXA_FileStream& s);
  static bool FreshLocked(const VEXA_FileStream& s);
};
