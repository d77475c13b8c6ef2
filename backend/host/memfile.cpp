// VEXA_InMemoryFile: a growable stream in memory.
//
// The window is the whole block: [cursor_, data_ + size_) may be read and
// [cursor_, data_ + capacity_) written. The codec's writes through the window
// move cursor_ past size_ without a call; Sync() takes the size up to the
// cursor before any operation that depends on it.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>

#include "isort/host/iostore.h"

#if defined(__linux__)
#include <sys/mman.h>
#endif

namespace {

// Large stores are read back in random order (one record at a time, in key
// order): huge pages spare a TLB miss on nearly every record.
void AdviseHugePages(void* block, std::size_t bytes) {
#if defined(__linux__) && defined(MADV_HUGEPAGE)
  const std::uintptr_t huge = 2u << 20;
  if (bytes < 2 * huge) return;
  const std::uintptr_t begin = (reinterpret_cast<std::uintptr_t>(block) + huge - 1) & ~(huge - 1);
  const std::uintptr_t end = (reinterpret_cast<std::uintptr_t>(block) + bytes) & ~(huge - 1);
  if (end > begin) madvise(reinterpret_cast<void*>(begin), end - begin, MADV_HUGEPAGE);
#else
  (void)block;
  (void)bytes;
#endif
}

}  // namespace

VEXA_InMemoryFile::VEXA_InMemoryFile(unsigned int initialSize)
    : data_(nullptr), capacity_(0), size_(0) {
  if (initialSize) {
    data_ = static_cast<unsigned char*>(std::malloc(initialSize));
    if (!data_) throw std::bad_alloc();
    capacity_ = initialSize;
    AdviseHugePages(data_, capacity_);
  }
  cursor_ = readEnd_ = data_;
  writeEnd_ = data_ + capacity_;
}

VEXA_InMemoryFile::~VEXA_InMemoryFile() { std::free(data_); }

void VEXA_InMemoryFile::Sync() const {
  const std::size_t position = static_cast<std::size_t>(cursor_ - data_);
  if (position > size_) size_ = position;
}

void VEXA_InMemoryFile::Reserve(std::size_t bytes) {
  if (bytes <= capacity_) return;
  const std::size_t maximum = std::numeric_limits<std::size_t>::max();
  std::size_t grown = capacity_ > maximum - capacity_ / 4 ? maximum : capacity_ + capacity_ / 4;
  std::size_t target = grown > bytes ? grown : bytes;
  void* memory = std::realloc(data_, target);
  if (!memory && target > bytes) {
    target = bytes;
    memory = std::realloc(data_, target);
  }
  if (!memory) throw std::bad_alloc();
  const std::size_t position = static_cast<std::size_t>(cursor_ - data_);
  data_ = static_cast<unsigned char*>(memory);
  capacity_ = target;
  AdviseHugePages(data_, capacity_);
  cursor_ = data_ + position;
  readEnd_ = data_ + size_;
  writeEnd_ = data_ + capacity_;
}

unsigned int VEXA_InMemoryFile::Read(void* buffer, unsigned int bytes) {
  Sync();
  const std::size_t position = static_cast<std::size_t>(cursor_ - data_);
  const std::size_t available = size_ - position;
  const unsigned int n = available < bytes ? static_cast<unsigned int>(available) : bytes;
  if (n) std::memcpy(buffer, cursor_, n);
  cursor_ += n;
  readEnd_ = data_ + size_;
  if (n < bytes) atEnd_ = true;
  return n;
}

unsigned int VEXA_InMemoryFile::Write(const void* buffer, unsigned int bytes) {
  if (bytes == 0) return 0;
  Sync();
  const std::size_t position = static_cast<std::size_t>(cursor_ - data_);
  if (bytes > std::numeric_limits<std::size_t>::max() - position) throw std::bad_alloc();
  Reserve(position + bytes);
  std::memcpy(cursor_, buffer, bytes);
  cursor_ += bytes;
  Sync();
  readEnd_ = data_ + size_;
  return bytes;
}

int VEXA_InMemoryFile::Seek(std::int64_t position, SeekDirection from) {
  Sync();
  std::int64_t base;
  switch (from) {
    case SeekBegin:
      base = 0;
      break;
    case SeekCurrent:
      base = cursor_ - data_;
      break;
    case SeekEnd:
      base = static_cast<std::int64_t>(size_);
      break;
    default:
      return 1;
  }
  // base lies in [0, size_], so only a far-out position can overflow.
  if (position > static_cast<std::int64_t>(size_) || position < -static_cast<std::int64_t>(size_))
    return 1;
  const std::int64_t target = base + position;
  if (target < 0 || target > static_cast<std::int64_t>(size_)) return 1;
  cursor_ = data_ + target;
  readEnd_ = data_ + size_;
  atEnd_ = false;
  return 0;
}

std::int64_t VEXA_InMemoryFile::Tell() const { return cursor_ - data_; }

std::int64_t VEXA_InMemoryFile::Size() const {
  Sync();
  return static_cast<std::int64_t>(size_);
}
