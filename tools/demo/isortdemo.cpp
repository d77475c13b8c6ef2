// isortdemo: the sort library at work on a table of a few million survey
// records, made on the fly, sorted by a string key and a descending numeric
// key with the default memory target. Prints what the sort did and checks
// the order of what it delivered.
//
//   isortdemo [RECORDS]      (default 3,000,000)
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Random.h"
#include "isort/FileSort.h"
#include "isort/host/errhub.h"

namespace {

// A record: case id, district (16 bytes of text over values 1-2), age,
// income, household size, weight, interview minutes.
constexpr unsigned kValues = 8;
const char* const kRegions[] = {"Central", "Coast", "Delta", "East", "Highlands", "Islands",
                                "Metro", "North", "Plains", "South", "Valley", "West"};

void MakeRecord(std::uint64_t id, OBS* record) {
  sortbench::Random rng(sortbench::Mix64(id));
  char district[16];
  std::memset(district, ' ', sizeof district);
  const int n = std::snprintf(district, sizeof district, "%s/%02u", kRegions[rng.Below(12)], 1 + rng.Below(20));
  district[n] = ' ';  // blank-padded text, as the host stores strings
  const double values[] = {static_cast<double>(id), 0, 0, static_cast<double>(18 + rng.Below(73)),
                           1000.0 * rng.Below(150), static_cast<double>(1 + rng.Below(7)), 0.5 + rng.Unit(),
                           static_cast<double>(10 + rng.Below(50))};
  std::memcpy(record, values, sizeof values);
  std::memcpy(record + 1, district, sizeof district);
}

// Sorts by district ascending, then income descending; counts and checks
// what comes out.
class SurveySort : public FileSort {
 public:
  SurveySort(std::uint64_t records, Statistics* stats)
      : FileSort({{1, +1, 16}, {4, -1, 0}}, kValues, stats), records_(records) {}

  const OBS* GetRecord() override {
    if (next_ == records_) return nullptr;
    MakeRecord(next_++, record_);
    return record_;
  }

  void PutRecord(const OBS* record) override {
    if (delivered_ != 0) {
      const int c = std::memcmp(previous_ + 1, record + 1, 16);
      double income0, income1, id0, id1;
      std::memcpy(&income0, previous_ + 4, 8);
      std::memcpy(&income1, record + 4, 8);
      std::memcpy(&id0, previous_, 8);
      std::memcpy(&id1, record, 8);
      if (c > 0 || (c == 0 && income0 < income1)) ++outOfOrder_;
      if (c == 0 && income0 == income1 && id0 > id1) ++unstable_;
    }
    std::memcpy(previous_, record, sizeof previous_);
    ++delivered_;
  }

  std::uint64_t Delivered() const { return delivered_; }
  std::uint64_t OutOfOrder() const { return outOfOrder_; }
  std::uint64_t Unstable() const { return unstable_; }

 private:
  std::uint64_t records_;
  std::uint64_t next_ = 0;
  OBS record_[kValues];
  OBS previous_[kValues];
  std::uint64_t delivered_ = 0;
  std::uint64_t outOfOrder_ = 0;
  std::uint64_t unstable_ = 0;
};

std::string Grouped(std::uint64_t n) {
  std::string digits = std::to_string(n), out;
  for (std::size_t i = 0; i < digits.size(); ++i) {
    if (i != 0 && (digits.size() - i) % 3 == 0) out.push_back(',');
    out.push_back(digits[i]);
  }
  return out;
}

}  // namespace

int main(int argc, char** argv) {
  const std::uint64_t records = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 3000000;
  std::printf("Sorting %s generated survey records (%u values, %u bytes each)\n", Grouped(records).c_str(),
              kValues, kValues * 8);
  std::printf("by district (a 16-byte string) ascending, then income descending,\n");
  std::printf("with the default memory target of 100 MiB.\n\n");

  FileSort::Statistics stats;
  const auto start = std::chrono::steady_clock::now();
  std::uint64_t delivered = 0, outOfOrder = 0, unstable = 0;
  try {
    SurveySort sort(records, &stats);
    sort.Sort();
    delivered = sort.Delivered();
    outOfOrder = sort.OutOfOrder();
    unstable = sort.Unstable();
  } catch (const ErrorText& e) {
    std::fprintf(stderr, "isortdemo: the sort failed: %s\n", e.Text().c_str());
    return 1;
  } catch (const std::bad_alloc&) {
    std::fprintf(stderr, "isortdemo: out of memory\n");
    return 1;
  }
  const double total = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();

  std::uint64_t fewest = stats.runs.empty() ? 0 : UINT64_MAX, most = 0, merged = 0;
  std::uint64_t read = 0, sorted = 0, written = 0;
  for (const FileSort::Statistics::RunInfo& run : stats.runs) {
    fewest = std::min<std::uint64_t>(fewest, run.records);
    most = std::max<std::uint64_t>(most, run.records);
    read += run.readTime2;
    sorted += run.sortTime2;
    written += run.writeTime2;
  }
  for (const FileSort::Statistics::MergeInfo& m : stats.merges) merged += m.bytes;
  const double inputPhase = stats.runPhaseTime2 / 1000.0;
  std::printf("  records                 %s\n", Grouped(stats.records).c_str());
  std::printf("  threads                 %u\n", stats.threads);
  std::printf("  runs                    %zu (%s to %s records each)\n", stats.runs.size(), Grouped(fewest).c_str(),
              Grouped(most).c_str());
  std::printf("  merge passes            %zu\n", stats.merges.size());
  std::printf("  temporary bytes written %.1f MB (runs %.1f MB, intermediate merges %.1f MB)\n",
              static_cast<double>(stats.workFileBytes + merged) / 1e6, static_cast<double>(stats.workFileBytes) / 1e6,
              static_cast<double>(merged) / 1e6);
  std::printf("  input phase             %.2f s wall, %.2f s CPU (summed over runs: read %.2f s, sort %.2f s, "
              "write %.2f s)\n",
              inputPhase, stats.runPhaseTime1 / 1000.0, read / 1000.0, sorted / 1000.0, written / 1000.0);
  for (std::size_t i = 0; i < stats.merges.size(); ++i) {
    std::printf("  merge pass %-12zu %.2f s wall, %.2f s CPU, %u runs%s\n", i + 1, stats.merges[i].time2 / 1000.0,
                stats.merges[i].time1 / 1000.0, stats.merges[i].runs,
                stats.merges[i].bytes == 0 ? " (the final pass, delivering)" : "");
  }
  std::printf("  total                   %.2f s (%.2f million records/s)\n\n", total,
              total > 0 ? static_cast<double>(records) / total / 1e6 : 0.0);
  const bool ok = delivered == records && outOfOrder == 0 && unstable == 0;
  std::printf("Check: %s records delivered, %s out of key order, %s ties out of input order: %s\n",
              Grouped(delivered).c_str(), Grouped(outOfOrder).c_str(), Grouped(unstable).c_str(),
              ok ? "OK" : "FAILED");
  return ok ? 0 : 1;
}
