// ptask: the host's parallel problem driver.
//
// A problem is split into parts, one per thread. The driver creates the parts
// with CreatePart() on the calling thread, then calls the parts' GetWork() one
// at a time (never two at once, across all parts) and, after each true result,
// that part's DoWork(), which may run in parallel with other parts' calls.
// Once every part's GetWork() has returned false, Finish() is called once per
// part and the parts are deleted, on the calling thread, with no GetWork()
// running. When Driver() returns, everything the parts wrote is visible to
// the calling thread.
//
// An exception that leaves a part (GetWork, DoWork, Finish) or CreatePart()
// stops the problem: no further GetWork() starts, the running workers finish
// their current call, every part is deleted, and the first such exception is
// rethrown from Driver() on the calling thread.
#pragma once

#include "vexatypes.h"

namespace ptask {

class ProblemPartBase {
 public:
  virtual ~ProblemPartBase() {}
  // Takes the next piece of work; true when there is one for DoWork().
  // Serialised by the driver across all parts.
  virtual bool GetWork() = 0;
  // Carries out the piece taken by the preceding true GetWork().
  virtual void DoWork() = 0;
  // Called once after the part's last DoWork(); serialised like GetWork().
  virtual void Finish() = 0;
};

class ProblemBase {
 public:
  virtual ~ProblemBase() {}
  // A new part, owned by the driver, which deletes it before Driver() returns.
  virtual ProblemPartBase* CreatePart() = 0;
};

// Runs `problem` with `threads` parts and worker threads (at least 1) and
// returns when every part is done and deleted. `problem` is not owned.
VEXAHOST_API void Driver(ProblemBase* problem, int threads);

}  // namespace ptask
