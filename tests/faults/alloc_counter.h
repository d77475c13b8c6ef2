// A counting replacement of the global operator new and delete (every form:
// plain, array, sized, aligned, nothrow), linked into the fault-test binary
// only. Because the executable defines them, the sort and host libraries'
// allocations come here too.
//
// Disarmed (the default) it passes every request to malloc and counts
// nothing. Armed, it numbers the allocations of all threads from 1, keeps the
// bytes of the blocks allocated while armed that are still live and their
// peak, and fails the planned allocation (std::bad_alloc, or null for the
// nothrow forms): one, or that one and every later one.
//
// Each block carries a small header with its size and whether it was
// counted, so a block may be allocated armed and freed disarmed (or the
// reverse) and the live count stays exact. Blocks from malloc itself (the
// host's stream buffers and memory files) are not seen here.
#pragma once

#include <cstdint>

namespace faults {

struct AllocationPlan {
  // 1-based number of the allocation that fails, counted from Arm; 0: none
  // fails, the plan only counts.
  std::uint64_t failAt = 0;
  // Fail every allocation from failAt on, not only that one.
  bool fromThenOn = false;
};

// Arms `plan`, replacing any armed one: restarts the numbering and the
// failure flag, and starts the peak at the current live bytes. Live bytes
// carry on across plans.
void ArmAllocations(const AllocationPlan& plan);
void DisarmAllocations();

// Allocations numbered since the plan was armed.
std::uint64_t AllocationsSeen();
// True once the armed plan has failed an allocation.
bool AllocationFailed();
// Bytes and blocks allocated while armed and not yet freed.
std::int64_t LiveBytes();
std::int64_t LiveBlocks();
// The highest LiveBytes() since the plan was armed.
std::int64_t PeakBytes();

// Arms a plan for the life of the object; disarms on destruction.
class ScopedAllocationPlan {
 public:
  explicit ScopedAllocationPlan(const AllocationPlan& plan) { ArmAllocations(plan); }
  ~ScopedAllocationPlan() { DisarmAllocations(); }
  ScopedAllocationPlan(const ScopedAllocationPlan&) = delete;
  ScopedAllocationPlan& operator=(const ScopedAllocationPlan&) = delete;
};

}  // namespace faults
