// A one-line progress display on standard error: the phase, how far it is,
// its throughput and an estimate of the time it has left.
//
// Update() is called from the hot loops (the sort's callbacks): it costs a
// comparison until `checkEvery` more items have passed, then one clock
// reading; the line is redrawn at most four times a second. Calls must not
// overlap (the sort never runs its callbacks at the same time).
#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace isortcli {

class Progress {
 public:
  explicit Progress(bool enabled) : enabled_(enabled) {}
  ~Progress() { Clear(); }
  Progress(const Progress&) = delete;
  Progress& operator=(const Progress&) = delete;

  bool Enabled() const { return enabled_; }
  // Starts a phase. `total` 0: unknown. `unit`: "rows", "records" or "bytes"
  // (bytes are shown in MB).
  void Start(const std::string& phase, std::uint64_t total, const char* unit, std::uint64_t checkEvery);
  void Update(std::uint64_t done) {
    if (done >= nextCheck_) Check(done);
  }
  // Erases the line.
  void Clear();

 private:
  typedef std::chrono::steady_clock Clock;
  void Check(std::uint64_t done);
  void Draw(std::uint64_t done, double seconds);

  bool enabled_;
  bool drawn_ = false;
  std::string phase_;
  const char* unit_ = "";
  std::uint64_t total_ = 0;
  std::uint64_t step_ = 1;
  std::uint64_t nextCheck_ = UINT64_MAX;
  Clock::time_point start_;
  Clock::time_point lastDraw_;
};

// "12.3M", "950k", "42": a count for people.
std::string ShortCount(double n);

}  // namespace isortcli
