#include "Workloads.h"

#include <cstring>

#include "Random.h"

namespace sortbench {
namespace {

const char* const kWords[20] = {"ANALYSIS", "BASELINE", "CATEGORY", "DATABASE", "ESTIMATE",
                                "FREQUENT", "GROUPING", "HOUSHOLD", "INTERVAL", "JUNCTION",
                                "KEYBOARD", "LIKELIHD", "MEASURES", "NATIONAL", "OUTLIERS",
                                "PARAMETR", "QUARTILE", "RESPONSE", "SAMPLING", "TABULATE"};

inline void Put(OBS* at, double d) { std::memcpy(at, &d, sizeof d); }

inline double Uniform(std::uint64_t bits) {
  return static_cast<double>(bits >> 11) * (1.0 / 9007199254740992.0);
}

}  // namespace

bool ParseWorkload(const std::string& name, Workload* w) {
  if (name == "W1" || name == "w1") {
    *w = Workload::W1;
  } else if (name == "W2" || name == "w2") {
    *w = Workload::W2;
  } else if (name == "W3" || name == "w3") {
    *w = Workload::W3;
  } else {
    return false;
  }
  return true;
}

const char* WorkloadName(Workload w) {
  switch (w) {
    case Workload::W1:
      return "W1";
    case Workload::W2:
      return "W2";
    case Workload::W3:
      return "W3";
  }
  return "?";
}

const char* WorkloadDescription(Workload w) {
  switch (w) {
    case Workload::W1:
      return "uniform doubles, one ascending numeric key";
    case Workload::W2:
      return "12-letter string key (width 12) asc, then a double desc";
    case Workload::W3:
      return "tie-heavy: one of 20 words (width 8) asc, then age 18-90 desc";
  }
  return "?";
}

unsigned MinimumValues(Workload w) {
  switch (w) {
    case Workload::W1:
      return 2;
    case Workload::W2:
      return 7;
    case Workload::W3:
      return 5;
  }
  return 2;
}

std::vector<FileSort::SortKey> WorkloadKeys(Workload w) {
  switch (w) {
    case Workload::W1:
      return {{0, 1, 0}};
    case Workload::W2:
      return {{1, 1, 12}, {5, -1, 0}};
    case Workload::W3:
      return {{1, 1, 8}, {2, -1, 0}};
  }
  return {};
}

RecordGenerator::RecordGenerator(Workload w, unsigned nvars, std::uint64_t seed)
    : workload_(w), nvars_(nvars), seed_(seed) {}

void RecordGenerator::Make(std::uint64_t index, OBS* record) const {
  // Each value is drawn from the hash of (seed, index, value number): any
  // record can be made alone, in any order, on any thread.
  const std::uint64_t base = Mix64(seed_ ^ (index * 0xD1B54A32D192ED03ull));
  const unsigned last = nvars_ - 1;
  switch (workload_) {
    case Workload::W1:
      for (unsigned v = 0; v < last; ++v) Put(record + v, Uniform(Mix64(base + v)));
      break;
    case Workload::W2: {
      for (unsigned v = 0; v < last; ++v) {
        if (v == 1 || v == 2) continue;
        Put(record + v, Uniform(Mix64(base + v)));
      }
      char text[16];
      std::uint64_t bits = Mix64(base + 100);
      for (int i = 0; i < 12; ++i) {
        if (i == 6) bits = Mix64(base + 101);
        text[i] = static_cast<char>('A' + (bits % 26));
        bits /= 26;
      }
      std::memset(text + 12, 0, 4);
      std::memcpy(record + 1, text, 16);
      break;
    }
    case Workload::W3: {
      const std::uint64_t bits = Mix64(base);
      Put(record + 0, static_cast<double>(1 + (bits >> 40) % 9));
      std::memcpy(record + 1, kWords[(bits >> 8) % 20], 8);
      Put(record + 2, static_cast<double>(18 + (bits >> 24) % 73));
      for (unsigned v = 3; v < last; ++v) {
        const std::uint64_t b = Mix64(base + v);
        Put(record + v, v < 5 ? Uniform(b) * 1000.0 : static_cast<double>(1 + b % 9));
      }
      break;
    }
  }
  Put(record + last, static_cast<double>(index));
}

std::uint64_t RecordHash(const OBS* record, unsigned nvars) {
  std::uint64_t h = nvars;
  for (unsigned i = 0; i < nvars; ++i) {
    std::uint64_t bits;
    std::memcpy(&bits, record + i, sizeof bits);
    h = (h ^ bits) * 0x100000001B3ull + (h >> 29);
  }
  return Mix64(h);
}

int CompareByKeys(const std::vector<FileSort::SortKey>& keys, const OBS* a, const OBS* b) {
  for (const FileSort::SortKey& key : keys) {
    int r = 0;
    if (key.width == 0) {
      double x, y;
      std::memcpy(&x, a + key.variable, sizeof x);
      std::memcpy(&y, b + key.variable, sizeof y);
      r = x < y ? -1 : (x > y ? 1 : 0);
    } else {
      r = std::memcmp(a + key.variable, b + key.variable, key.width);
      r = r < 0 ? -1 : (r > 0 ? 1 : 0);
    }
    if (r != 0) return r * key.direction;
  }
  return 0;
}

OrderChecker::OrderChecker(std::vector<FileSort::SortKey> keys, unsigned nvars)
    : keys_(std::move(keys)), nvars_(nvars), previous_(nvars) {}

void OrderChecker::Check(const OBS* record) {
  const int c = CompareByKeys(keys_, previous_.data(), record);
  if (c > 0) {
    ++order_;
  } else if (c == 0) {
    double before, now;
    std::memcpy(&before, &previous_[nvars_ - 1], sizeof before);
    std::memcpy(&now, record + nvars_ - 1, sizeof now);
    if (before > now) ++stability_;
  }
}

}  // namespace sortbench
