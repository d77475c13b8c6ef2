// iostore: byte streams over temporary files and memory, and the compressed
// case encoding that moves records through them.
//
// Streams are not thread-safe: each object is used by one thread at a time.
// Copies of one temporary file (VEXA_TempFile's copy constructor) share the
// open file, each with its own position and buffer; they may be used on
// different threads when no object holds unflushed writes while another
// reads (the sort writes a file completely before it copies it for reading).
//
// Errors: a failed or short system read or write, or a file that cannot be
// created, throws ErrorText whose text names the operation, the file and the
// system's reason. Running out of memory throws std::bad_alloc.
#pragma once

#include <cstddef>
#include <cstdint>

#include "vexatypes.h"

struct VEXA_StreamWindow;

class VEXAHOST_API VEXA_StrBaseIO {
 public:
  enum SeekDirection { SeekBegin = 0, SeekCurrent = 1, SeekEnd = 2 };

  virtual ~VEXA_StrBaseIO();
  // Clears the failure and end-of-file states.
  virtual void Clear();
  // Nonzero while no operation has failed since the last Clear().
  virtual int Good();
  // Reads up to `bytes`; returns the count read, short only at end of data.
  virtual unsigned int Read(void* buffer, unsigned int bytes) = 0;
  // Writes `bytes` (growing the stream as needed); returns `bytes`.
  virtual unsigned int Write(const void* buffer, unsigned int bytes) = 0;
  // Moves the position; 0 on success, nonzero (and nothing moved) otherwise.
  virtual int Seek(std::int64_t position, SeekDirection from) = 0;
  // The current byte position.
  virtual std::int64_t Tell() const = 0;
  // Nonzero once a read has reached the end of the data.
  virtual int EndOfFile();

 protected:
  VEXA_StrBaseIO();
  VEXA_StrBaseIO(const VEXA_StrBaseIO&);
  VEXA_StrBaseIO& operator=(const VEXA_StrBaseIO&) = delete;

  // A window on the object's buffer at the current position, which the
  // record codec uses directly to avoid a virtual call per value. Bytes in
  // [cursor_, readEnd_) are the next bytes of the stream; [cursor_, writeEnd_)
  // is room that may be written. Moving cursor_ forward by n over either
  // range is the same as a Read or Write of n bytes. Either range may be
  // empty (end at or below the cursor); the virtual operations resync them.
  unsigned char* cursor_;
  unsigned char* readEnd_;
  unsigned char* writeEnd_;
  bool failed_;
  bool atEnd_;
  friend struct VEXA_StreamWindow;
};

// A stream over a named or temporary file, read and written through a buffer
// of its own with positioned I/O.
class VEXAHOST_API VEXA_FileStream : public VEXA_StrBaseIO {
 public:
  VEXA_FileStream();
  ~VEXA_FileStream() override;

  unsigned int Read(void* buffer, unsigned int bytes) override;
  unsigned int Write(const void* buffer, unsigned int bytes) override;
  int Seek(std::int64_t position, SeekDirection from) override;
  std::int64_t Tell() const override;

  // Opens a named file; `mode` as fopen's ("rb", "wb", "ab", "r+b", "w+b").
  // Returns 0 on success, nonzero with Good() false otherwise.
  virtual int Open(const char* name, const char* mode);
  // Writes pending bytes to the file; 0 when the stream is in good state.
  virtual int Close() const;

  // True when another object refers to the same open file.
  bool IsShared() const;

  struct SharedFile;  // the open file, shared by copies; defined by the host

 protected:
  VEXA_FileStream(const VEXA_FileStream& other);  // same file, own position
  // Writes the buffer's pending bytes; throws ErrorText on failure.
  void FlushBuffer() const;
  void DropBuffer() const;
  void Attach(SharedFile* file);

  SharedFile* file_;               // shared, reference-counted; null when closed
  mutable unsigned char* buffer_;  // this object's buffer, allocated on first use
  unsigned int bufferSize_;
  mutable std::int64_t bufferPos_;  // file position of buffer_[0]
  mutable int mode_;                // 0 idle, 1 reading, 2 writing
  mutable std::uint64_t seenGeneration_;
  friend struct VEXA_StreamWindow;
};

// A temporary file in the host's temporary directory, named from `prefix`.
// With `removeWhenDone` true the file is removed with its last object (on
// POSIX it is unlinked as soon as it is created, so nothing is left even when
// the process dies). Copies share the file, each with its own position, and
// see everything written through the others without Flush().
class VEXAHOST_API VEXA_TempFile : public VEXA_FileStream {
 public:
  VEXA_TempFile(const char* prefix, bool removeWhenDone);
  VEXA_TempFile(const VEXA_TempFile& other);
  VEXA_TempFile& operator=(const VEXA_TempFile&) = delete;
  ~VEXA_TempFile() override;

  // Flushes and gives up this object's hold on the file.
  virtual void Close();
  // Writes this object's pending bytes to the file.
  virtual void Flush() const;
  // The file's path as created.
  virtual const char* Name() const;
  // Bytes of memory one open object holds: its buffer size.
  virtual unsigned int Footprint() const;
};

// A growable stream in memory. Reserves `initialSize` bytes up front (throws
// std::bad_alloc when it cannot) and grows as writes need.
class VEXAHOST_API VEXA_InMemoryFile : public VEXA_StrBaseIO {
 public:
  explicit VEXA_InMemoryFile(unsigned int initialSize);
  ~VEXA_InMemoryFile() override;
  VEXA_InMemoryFile(const VEXA_InMemoryFile&) = delete;

  unsigned int Read(void* buffer, unsigned int bytes) override;
  unsigned int Write(const void* buffer, unsigned int bytes) override;
  int Seek(std::int64_t position, SeekDirection from) override;
  std::int64_t Tell() const override;

  // Bytes written so far (the highest position reached by a write).
  std::int64_t Size() const;
  // Bytes reserved.
  std::size_t Capacity() const { return capacity_; }

 private:
  void Sync() const;
  void Reserve(std::size_t bytes);

  unsigned char* data_;
  std::size_t capacity_;
  mutable std::size_t size_;
  friend struct VEXA_StreamWindow;
};

// Records of `n` values in the compressed case encoding. The system-missing
// value is the host's (vexawcom.h). WriteCompressed writes one record at the
// stream's position. ReadCompressed reads one record bit for bit and returns
// false when the data ends inside it or holds an undefined code (what it
// wrote is then unreliable). CopyPrecompressed moves one record's encoded
// bytes unchanged, with the same false result.
VEXAHOST_API void WriteCompressed(VEXA_StrBaseIO& to, const OBS* values, long n);
VEXAHOST_API bool ReadCompressed(VEXA_StrBaseIO& from, OBS* values, long n);
VEXAHOST_API bool CopyPrecompressed(VEXA_StrBaseIO& from, VEXA_StrBaseIO& to, long n);

// The compressed case encoding over memory: the one codec behind the stream
// functions above, shared with the packed sort records.
//
// Values go in groups of eight: an 8-byte control block, one code per value,
// then the 8-byte values whose code is 253. Codes: 1-251 the integer
// code - 100 (as a double; 100 is +0.0), 253 the value follows, 254 eight
// blanks, 255 the system-missing value, 0 padding after the last value.
// Values are coded by bit pattern, whatever they hold.
enum : unsigned char {
  kCodePadding = 0,
  kCodeLiteral = 253,
  kCodeBlanks = 254,
  kCodeMissing = 255,
};

// The code of one 8-byte value, given the system-missing pattern.
VEXAHOST_API unsigned char VEXA_CaseCode(const OBS* value, const OBS* missing);

// Most bytes that n values can take when encoded.
inline std::size_t VEXA_CompressedBound(std::size_t n) { return n * 8 + (n + 7) / 8 * 8; }

// Encoding into memory that the caller has sized with VEXA_CompressedBound.
// Groups run on across calls of VEXA_EncodeValues until VEXA_EncodeFinish.
struct VEXA_CaseEncoder {
  unsigned char* next;     // where the next byte goes
  unsigned char* control;  // control block of the open group
  unsigned int codes;      // codes in the open group (0 to 8)
};
VEXAHOST_API void VEXA_EncodeStart(VEXA_CaseEncoder& encoder, void* out);
VEXAHOST_API void VEXA_EncodeValues(VEXA_CaseEncoder& encoder, const OBS* values, std::size_t n,
                                    const OBS* missing);
// Pads the open group with 0 codes; returns one past the last byte written.
VEXAHOST_API unsigned char* VEXA_EncodeFinish(VEXA_CaseEncoder& encoder);

// Decoding from the `size` bytes at `data`; never reads outside them.
struct VEXA_CaseDecoder {
  const unsigned char* next;     // next unread byte
  const unsigned char* end;      // one past the last readable byte
  const unsigned char* control;  // control block of the current group
  unsigned int codes;            // codes of the current group already used
  bool damaged;                  // the data ended early or held an undefined code
};
VEXAHOST_API void VEXA_DecodeStart(VEXA_CaseDecoder& decoder, const void* data, std::size_t size);
// Decodes n values. A value whose code is undefined (0 or 252 inside the
// values) or whose bytes lie past the end becomes the missing value and
// marks the decoder damaged. Returns !damaged.
VEXAHOST_API bool VEXA_DecodeValues(VEXA_CaseDecoder& decoder, OBS* values, std::size_t n,
                                    const OBS* missing);
