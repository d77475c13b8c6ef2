// A counting replacement of the global operator new and delete (every form:
// plain, array, sized, aligned, nothrow), linked into the fault-test binary
// only, so the sort and host libraries' allocations come here too.
//
// Disarmed (the default) it passes every request to malloc and counts
// nothing. Armed, it numbers the allocations of all threads from 1, keeps the
// bytes and blocks allocated while armed that are still live, and fails the
// planned allocation (std::bad_alloc, or null for the nothrow forms): one,
// or that one and every later one. Each block's header says whether it was
// counted, so a block may be allocated armed and freed disarmed (or the
// reverse) and the live count stays exact. Blocks from malloc itself (the
// host's stream buffers and memory files) are not seen here.
#pragma once

#include <cstdint>

namespace faults {

struct AllocationPlan {
  std::uint64_t failAt = 0;  // 1-based number of the allocation that fails; 0: none
  bool fromThenOn = false;   // fail every allocation from failAt on
};

// Arms `plan`, replacing any armed one: restarts the numbering and the
// failure flag. Live bytes carry on across plans.
void ArmAllocations(const AllocationPlan& plan);
void DisarmAllocations();

std::uint64_t AllocationsSeen();  // numbered since the plan was armed
bool AllocationFailed();          // the armed plan has failed an allocation
std::int64_t LiveBytes();         // allocated while armed and not yet freed
std::int64_t LiveBlocks();

}  // namespace faults
