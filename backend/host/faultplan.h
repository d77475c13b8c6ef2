// Fault injection into the stand-in host's file layer, for tests.
//
// Every system file operation of the streams (creating or opening a file,
// querying its size, each positioned read or write call) passes through one
// layer that consults the armed plan. A planned failure is indistinguishable
// from a real one above that layer: the stream throws ErrorText naming the
// operation, the file and the system's text for the error, e.g.
// "write of /tmp/sortAbc123 failed: No space left on device".
//
// The plan is process-wide. Arm it before the operations it targets start and
// disarm it when they are done; operations of all threads are counted. While
// no plan is armed the layer pays one relaxed atomic load per operation.
#pragma once

#include <cerrno>

#include "isort/host/vexatypes.h"

namespace vexahost {

// Kinds of file operation. A retried partial transfer counts again.
enum class FileOp : int {
  Create = 0,  // making a temporary file or opening a named one
  Read = 1,    // one positioned read call
  Write = 2,   // one positioned write call
  Seek = 3,    // finding a file's size (opening a named file)
  Any = 4,     // any of the above
};

// Portable spellings of the system errors that tests inject.
#ifdef _WIN32
constexpr int kErrorNoSpace = 112;  // ERROR_DISK_FULL
constexpr int kErrorIo = 1117;      // ERROR_IO_DEVICE
#else
constexpr int kErrorNoSpace = ENOSPC;
constexpr int kErrorIo = EIO;
#endif

struct FaultPlan {
  // The kind of operation that fails.
  FileOp kind = FileOp::Any;
  // Which one fails: 1 is the first operation of `kind` after Arm; 0 makes
  // none fail, so the plan only counts.
  unsigned long long nth = 0;
  // The system error code it fails with (errno on POSIX, a GetLastError()
  // code on Windows). Ignored with shortTransfer.
  int error = kErrorIo;
  // Instead of failing, the nth operation (a read or write) moves only part
  // of its bytes, and every later read or write moves nothing while the plan
  // stays armed: a device that stops making progress.
  bool shortTransfer = false;
};

// Arms `plan`, replacing any armed one, and restarts the counts.
VEXAHOST_API void ArmFaultPlan(const FaultPlan& plan);
// Disarms the plan; operations are no longer counted.
VEXAHOST_API void DisarmFaultPlan();
// Operations of `kind` seen since the plan was armed (Any: of every kind).
VEXAHOST_API unsigned long long FileOperationsSeen(FileOp kind);
// True once the armed plan has injected its fault.
VEXAHOST_API bool FaultInjected();

// Arms a plan for the life of the object.
class ScopedFaultPlan {
 public:
  explicit ScopedFaultPlan(const FaultPlan& plan) { ArmFaultPlan(plan); }
  ~ScopedFaultPlan() { DisarmFaultPlan(); }
  ScopedFaultPlan(const ScopedFaultPlan&) = delete;
  ScopedFaultPlan& operator=(const ScopedFaultPlan&) = delete;
};

}  // namespace vexahost
