// Internal: how the file layer consults the fault plan.
#pragma once

#include <atomic>

#include "faultplan.h"

namespace vexahost {
namespace internal {

struct FaultVerdict {
  int error = 0;           // nonzero: fail with this system error
  bool partial = false;    // move only part of the bytes
  bool noProgress = false; // move nothing
};

extern std::atomic<bool> g_faultPlanArmed;
FaultVerdict ConsultArmedFaultPlan(FileOp kind);

// The verdict on one operation of `kind` (never Any).
inline FaultVerdict ConsultFaultPlan(FileOp kind) {
  if (!g_faultPlanArmed.load(std::memory_order_relaxed)) return FaultVerdict();
  return ConsultArmedFaultPlan(kind);
}

}  // namespace internal
}  // namespace vexahost
