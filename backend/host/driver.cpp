// ptask::Driver: parts on worker threads, GetWork() under one mutex.
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <vector>

#include "isort/host/ptask.h"

namespace ptask {
namespace {

// State the workers share; every field is touched with `mutex` held.
struct Run {
  std::mutex mutex;
  bool stop = false;
  std::exception_ptr failure;  // the first exception out of a part

  void Fail(std::exception_ptr e) {
    if (!failure) failure = e;
    stop = true;
  }
};

// One worker bound to one part: takes work under the mutex, does it outside.
void Work(ProblemPartBase* part, Run& run) {
  for (;;) {
    {
      std::lock_guard<std::mutex> lock(run.mutex);
      if (run.stop) return;
      bool taken;
      try {
        taken = part->GetWork();
      } catch (...) {
        run.Fail(std::current_exception());
        return;
      }
      if (!taken) return;
    }
    try {
      part->DoWork();
    } catch (...) {
      std::lock_guard<std::mutex> lock(run.mutex);
      run.Fail(std::current_exception());
      return;
    }
  }
}

}  // namespace

void Driver(ProblemBase* problem, int threads) {
  if (threads < 1) threads = 1;
  // Destroyed through their virtual destructors on every path out.
  std::vector<std::unique_ptr<ProblemPartBase>> parts;
  parts.reserve(static_cast<std::size_t>(threads));
  for (int i = 0; i < threads; ++i) parts.emplace_back(problem->CreatePart());

  Run run;
  std::vector<std::thread> workers;
  try {
    workers.reserve(parts.size() - 1);
    for (std::size_t i = 1; i < parts.size(); ++i)
      workers.emplace_back(Work, parts[i].get(), std::ref(run));
  } catch (...) {
    std::lock_guard<std::mutex> lock(run.mutex);
    run.Fail(std::current_exception());
  }
  // The calling thread drives the first part itself.
  Work(parts[0].get(), run);
  for (std::thread& worker : workers) worker.join();

  // Joined: every part's writes are visible here, and no GetWork() runs.
  for (auto& part : parts) {
    try {
      part->Finish();
    } catch (...) {
      if (!run.failure) run.failure = std::current_exception();
    }
  }
  parts.clear();
  if (run.failure) std::rethrow_exception(run.failure);
}

}  // namespace ptask
