// The fault plan's state. Only armed plans take the mutex; tests arm them.
#include <mutex>

#include "faulthook.h"

namespace vexahost {
namespace internal {

std::atomic<bool> g_faultPlanArmed{false};

namespace {

constexpr int kKinds = 5;

struct PlanState {
  std::mutex mutex;
  FaultPlan plan;
  unsigned long long seen[kKinds] = {};
  bool injected = false;
};

PlanState& State() {
  static PlanState state;
  return state;
}

}  // namespace

FaultVerdict ConsultArmedFaultPlan(FileOp kind) {
  PlanState& s = State();
  std::lock_guard<std::mutex> lock(s.mutex);
  FaultVerdict verdict;
  if (!g_faultPlanArmed.load(std::memory_order_relaxed)) return verdict;
  const bool transfer = kind == FileOp::Read || kind == FileOp::Write;
  ++s.seen[static_cast<int>(kind)];
  ++s.seen[static_cast<int>(FileOp::Any)];
  const FaultPlan& plan = s.plan;
  if (s.injected) {
    verdict.noProgress = plan.shortTransfer && transfer;
    return verdict;
  }
  if (plan.nth == 0) return verdict;
  if (plan.kind != FileOp::Any && plan.kind != kind) return verdict;
  if (s.seen[static_cast<int>(plan.kind)] < plan.nth) return verdict;
  // A short transfer needs a transfer: when the nth operation is none, the
  // next transfer takes the fault.
  if (plan.shortTransfer && !transfer) return verdict;
  s.injected = true;
  if (plan.shortTransfer)
    verdict.partial = true;
  else
    verdict.error = plan.error;
  return verdict;
}

}  // namespace internal

void ArmFaultPlan(const FaultPlan& plan) {
  internal::PlanState& s = internal::State();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.plan = plan;
  for (unsigned long long& n : s.seen) n = 0;
  s.injected = false;
  internal::g_faultPlanArmed.store(true, std::memory_order_relaxed);
}

void DisarmFaultPlan() {
  internal::PlanState& s = internal::State();
  std::lock_guard<std::mutex> lock(s.mutex);
  internal::g_faultPlanArmed.store(false, std::memory_order_relaxed);
}

unsigned long long FileOperationsSeen(FileOp kind) {
  internal::PlanState& s = internal::State();
  std::lock_guard<std::mutex> lock(s.mutex);
  int k = static_cast<int>(kind);
  return k >= 0 && k < internal::kKinds ? s.seen[k] : 0;
}

bool FaultInjected() {
  internal::PlanState& s = internal::State();
  std::lock_guard<std::mutex> lock(s.mutex);
  return s.injected;
}

}  // namespace vexahost
