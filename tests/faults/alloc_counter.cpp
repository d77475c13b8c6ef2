// The replaced global allocation functions and their counters. Everything
// here is constant-initialised, so allocations made by static constructors
// of any library before main() are served correctly.
#include "alloc_counter.h"

#include <atomic>
#include <cstddef>
#include <cstdio>
#include <cstdlib>
#include <new>

namespace faults {
namespace {

std::atomic<bool> g_armed{false};
std::atomic<std::uint64_t> g_failAt{0};
std::atomic<bool> g_fromThenOn{false};
std::atomic<std::uint64_t> g_seen{0};
std::atomic<bool> g_failed{false};
std::atomic<std::int64_t> g_liveBytes{0};
std::atomic<std::int64_t> g_liveBlocks{0};

// Lies just below the pointer handed out; 16 bytes keep that pointer at the
// alignment malloc gives.
struct Header {
  std::uint64_t size;    // bytes asked for
  std::uint32_t offset;  // from the malloc block to the pointer handed out
  std::uint32_t tag;     // kCounted or kUncounted; anything else is corruption
};
static_assert(sizeof(Header) == 16, "header keeps 16-byte alignment");
constexpr std::uint32_t kCounted = 0xC0C0A11Cu;
constexpr std::uint32_t kUncounted = 0x0A110C00u;

// Decides whether this allocation fails, numbering it when armed.
bool ShouldFail(bool* counted) {
  *counted = g_armed.load(std::memory_order_acquire);
  if (!*counted) return false;
  const std::uint64_t n = g_seen.fetch_add(1, std::memory_order_relaxed) + 1;
  const std::uint64_t at = g_failAt.load(std::memory_order_relaxed);
  if (at == 0 || n < at) return false;
  if (n != at && !g_fromThenOn.load(std::memory_order_relaxed)) return false;
  g_failed.store(true, std::memory_order_relaxed);
  return true;
}

// Null when the plan fails this allocation or malloc has nothing.
void* Allocate(std::size_t size, std::size_t alignment) {
  bool counted;
  if (ShouldFail(&counted)) return nullptr;
  if (alignment < alignof(std::max_align_t)) alignment = alignof(std::max_align_t);
  const std::size_t slack = sizeof(Header) + (alignment > sizeof(Header) ? alignment : 0);
  if (size > static_cast<std::size_t>(-1) - slack) return nullptr;
  unsigned char* raw = static_cast<unsigned char*>(std::malloc(size + slack));
  if (!raw) return nullptr;
  std::uintptr_t user = reinterpret_cast<std::uintptr_t>(raw) + sizeof(Header);
  user = (user + alignment - 1) & ~(static_cast<std::uintptr_t>(alignment) - 1);
  Header* h = reinterpret_cast<Header*>(user) - 1;
  h->size = size;
  h->offset = static_cast<std::uint32_t>(user - reinterpret_cast<std::uintptr_t>(raw));
  h->tag = counted ? kCounted : kUncounted;
  if (counted) {
    g_liveBytes.fetch_add(static_cast<std::int64_t>(size), std::memory_order_relaxed);
    g_liveBlocks.fetch_add(1, std::memory_order_relaxed);
  }
  return reinterpret_cast<void*>(user);
}

void Release(void* p) {
  if (!p) return;
  Header* h = static_cast<Header*>(p) - 1;
  if (h->tag == kCounted) {
    g_liveBytes.fetch_sub(static_cast<std::int64_t>(h->size), std::memory_order_relaxed);
    g_liveBlocks.fetch_sub(1, std::memory_order_relaxed);
  } else if (h->tag != kUncounted) {
    std::fputs("operator delete: a block this allocator did not hand out\n", stderr);
    std::abort();
  }
  h->tag = 0;  // a second delete of the same block then aborts
  std::free(static_cast<unsigned char*>(p) - h->offset);
}

void* AllocateOrThrow(std::size_t size, std::size_t alignment) {
  void* p = Allocate(size, alignment);
  if (!p) throw std::bad_alloc();
  return p;
}

}  // namespace

void ArmAllocations(const AllocationPlan& plan) {
  g_armed.store(false, std::memory_order_release);
  g_failAt.store(plan.failAt, std::memory_order_relaxed);
  g_fromThenOn.store(plan.fromThenOn, std::memory_order_relaxed);
  g_seen.store(0, std::memory_order_relaxed);
  g_failed.store(false, std::memory_order_relaxed);
  g_armed.store(true, std::memory_order_release);
}

void DisarmAllocations() { g_armed.store(false, std::memory_order_release); }

std::uint64_t AllocationsSeen() { return g_seen.load(std::memory_order_relaxed); }
bool AllocationFailed() { return g_failed.load(std::memory_order_relaxed); }
std::int64_t LiveBytes() { return g_liveBytes.load(std::memory_order_relaxed); }
std::int64_t LiveBlocks() { return g_liveBlocks.load(std::memory_order_relaxed); }

}  // namespace faults

using faults::Allocate;
using faults::AllocateOrThrow;
using faults::Release;
using std::align_val_t;
using std::nothrow_t;
using std::size_t;

void* operator new(size_t n) { return AllocateOrThrow(n, 0); }
void* operator new[](size_t n) { return AllocateOrThrow(n, 0); }
void* operator new(size_t n, const nothrow_t&) noexcept { return Allocate(n, 0); }
void* operator new[](size_t n, const nothrow_t&) noexcept { return Allocate(n, 0); }
void* operator new(size_t n, align_val_t a) { return AllocateOrThrow(n, size_t(a)); }
void* operator new[](size_t n, align_val_t a) { return AllocateOrThrow(n, size_t(a)); }
void* operator new(size_t n, align_val_t a, const nothrow_t&) noexcept {
  return Allocate(n, size_t(a));
}
void* operator new[](size_t n, align_val_t a, const nothrow_t&) noexcept {
  return Allocate(n, size_t(a));
}

void operator delete(void* p) noexcept { Release(p); }
void operator delete[](void* p) noexcept { Release(p); }
void operator delete(void* p, size_t) noexcept { Release(p); }
void operator delete[](void* p, size_t) noexcept { Release(p); }
void operator delete(void* p, const nothrow_t&) noexcept { Release(p); }
void operator delete[](void* p, const nothrow_t&) noexcept { Release(p); }
void operator delete(void* p, align_val_t) noexcept { Release(p); }
void operator delete[](void* p, align_val_t) noexcept { Release(p); }
void operator delete(void* p, size_t, align_val_t) noexcept { Release(p); }
void operator delete[](void* p, size_t, align_val_t) noexcept { Release(p); }
void operator delete(void* p, align_val_t, const nothrow_t&) noexcept { Release(p); }
void operator delete[](void* p, align_val_t, const nothrow_t&) noexcept { Release(p); }
