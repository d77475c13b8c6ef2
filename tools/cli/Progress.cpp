#include "Progress.h"

#include <cstdio>

namespace isortcli {

std::string ShortCount(double n) {
  char text[32];
  if (n >= 1e9) {
    std::snprintf(text, sizeof text, "%.2fG", n / 1e9);
  } else if (n >= 1e6) {
    std::snprintf(text, sizeof text, "%.2fM", n / 1e6);
  } else if (n >= 1e4) {
    std::snprintf(text, sizeof text, "%.0fk", n / 1e3);
  } else {
    std::snprintf(text, sizeof text, "%.0f", n);
  }
  return text;
}

void Progress::Start(const std::string& phase, std::uint64_t total, const char* unit,
                     std::uint64_t checkEvery) {
  if (!enabled_) return;
  phase_ = phase;
  total_ = total;
  unit_ = unit;
  step_ = checkEvery == 0 ? 1 : checkEvery;
  start_ = Clock::now();
  lastDraw_ = start_ - std::chrono::seconds(1);
  nextCheck_ = 0;
  Check(0);
}

void Progress::Check(std::uint64_t done) {
  nextCheck_ = done + step_;
  const Clock::time_point now = Clock::now();
  if (now - lastDraw_ < std::chrono::milliseconds(250)) return;
  lastDraw_ = now;
  Draw(done, std::chrono::duration<double>(now - start_).count());
}

void Progress::Draw(std::uint64_t done, double seconds) {
  const bool bytes = unit_[0] == 'b';
  const double scale = bytes ? 1e-6 : 1.0;
  std::string line = "isort: " + phase_;
  if (unit_[0] != 0) {
    line += ": " + (bytes ? ShortCount(done * scale) : ShortCount(static_cast<double>(done)));
    if (total_ != 0) line += " of " + (bytes ? ShortCount(total_ * scale) : ShortCount(static_cast<double>(total_)));
    line += bytes ? " MB" : std::string(" ") + unit_;
    if (total_ != 0) {
      char percent[16];
      std::snprintf(percent, sizeof percent, " (%.0f%%)", 100.0 * static_cast<double>(done) / static_cast<double>(total_));
      line += percent;
    }
    if (seconds > 0.5 && done > 0) {
      const double rate = static_cast<double>(done) / seconds;
      line += ", " + ShortCount(rate * scale) + (bytes ? " MB/s" : std::string(" ") + unit_ + "/s");
      if (total_ > done) {
        const double left = static_cast<double>(total_ - done) / rate;
        char text[48];
        if (left < 1.0) {
          std::snprintf(text, sizeof text, ", under 1 s left");
        } else {
          std::snprintf(text, sizeof text, ", about %.0f s left", left);
        }
        line += text;
      }
    }
  } else if (seconds >= 1.0) {
    char elapsed[32];
    std::snprintf(elapsed, sizeof elapsed, " (%.0f s)", seconds);
    line += elapsed;
  }
  std::fprintf(stderr, "\r%s\033[K", line.c_str());
  std::fflush(stderr);
  drawn_ = true;
}

void Progress::Clear() {
  if (drawn_) {
    std::fputs("\r\033[K", stderr);
    std::fflush(stderr);
    drawn_ = false;
  }
  nextCheck_ = UINT64_MAX;
}

}  // namespace isortcli
