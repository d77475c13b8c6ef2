#include "Bench.h"

#include <algorithm>
#include <array>
#include <chrono>
#include <cstring>
#include <cerrno>
#include <memory>
#include <stdexcept>
#include <utility>
#include <vector>

#include "host/hostsettings.h"
#include "isort/host/errhub.h"

#ifdef _WIN32
#include <io.h>
#else
#include <unistd.h>
#endif

namespace sortbench {
namespace {

typedef std::chrono::steady_clock Clock;

double Since(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

void ApplySettings(const BenchConfig& config) {
  if (config.threads != 0) vexahost::SetThreadSetting(config.threads);
  if (!config.tmpdir.empty()) vexahost::SetTempDirectory(config.tmpdir);
}

void Finish(Measurement& m, const OrderChecker& checker, std::uint64_t checksumIn, double seconds) {
  m.seconds = seconds;
  m.records = checker.Count();
  m.checksumIn = checksumIn;
  m.checksumOut = checker.Checksum();
  m.orderViolations = checker.OrderViolations();
  m.stabilityViolations = checker.StabilityViolations();
  m.ok = true;
}

class GeneratedSort : public FileSort {
 public:
  GeneratedSort(const BenchConfig& config, const std::vector<SortKey>& keys, Statistics* stats,
                OrderChecker& checker)
      : FileSort(keys, config.values, stats),
        generator_(config.workload, config.values),
        records_(config.records),
        record_(config.values),
        checker_(checker) {}

  const OBS* GetRecord() override {
    if (next_ == records_) return nullptr;
    generator_.Make(next_++, record_.data());
    checksum_ += RecordHash(record_.data(), generator_.Nvars());
    return record_.data();
  }
  void PutRecord(const OBS* record) override { checker_.Put(record); }
  std::uint64_t Checksum() const { return checksum_; }

 private:
  RecordGenerator generator_;
  std::uint64_t records_;
  std::uint64_t next_ = 0;
  std::vector<OBS> record_;
  OrderChecker& checker_;
  std::uint64_t checksum_ = 0;
};

template <unsigned N>
struct Record {
  OBS v[N];
};

template <unsigned N>
void StableSortN(const BenchConfig& config, Measurement& m) {
  const std::vector<FileSort::SortKey> keys = WorkloadKeys(config.workload);
  OrderChecker checker(keys, N);
  const RecordGenerator generator(config.workload, N);
  const Clock::time_point start = Clock::now();
  std::vector<Record<N>> records(static_cast<std::size_t>(config.records));
  std::uint64_t checksum = 0;
  for (std::uint64_t i = 0; i < config.records; ++i) {
    generator.Make(i, records[i].v);
    checksum += RecordHash(records[i].v, N);
  }
  std::stable_sort(records.begin(), records.end(), [&keys](const Record<N>& a, const Record<N>& b) {
    return CompareByKeys(keys, a.v, b.v) < 0;
  });
  for (const Record<N>& r : records) checker.Put(r.v);
  Finish(m, checker, checksum, Since(start));
}

typedef void (*StableSortFunction)(const BenchConfig&, Measurement&);

template <std::size_t... I>
constexpr std::array<StableSortFunction, sizeof...(I)> StableSortTable(std::index_sequence<I...>) {
  return {{&StableSortN<static_cast<unsigned>(I + kMinValues)>...}};
}

// One large block of whole records.
std::size_t BlockBytes(std::size_t recordBytes) {
  const std::size_t target = std::size_t{4} << 20;
  return recordBytes >= target ? recordBytes : target / recordBytes * recordBytes;
}

void WriteAll(int fd, const char* data, std::size_t bytes) {
  while (bytes > 0) {
#ifdef _WIN32
    const int n = _write(fd, data, static_cast<unsigned>(bytes));
#else
    const ssize_t n = ::write(fd, data, bytes);
#endif
    if (n <= 0) throw std::runtime_error(std::string("writing the scratch file: ") + std::strerror(errno));
    data += n;
    bytes -= static_cast<std::size_t>(n);
  }
}

std::size_t ReadSome(int fd, char* data, std::size_t bytes) {
  std::size_t done = 0;
  while (done < bytes) {
#ifdef _WIN32
    const int n = _read(fd, data + done, static_cast<unsigned>(bytes - done));
#else
    const ssize_t n = ::read(fd, data + done, bytes - done);
#endif
    if (n < 0) throw std::runtime_error(std::string("reading the scratch file: ") + std::strerror(errno));
    if (n == 0) break;
    done += static_cast<std::size_t>(n);
  }
  return done;
}

std::string Ratio(double a, double b) {
  char text[32];
  std::snprintf(text, sizeof text, "%.2f", b > 0 ? a / b : 0.0);
  return text;
}

void PrintLine(std::FILE* out, const char* name, const Measurement& m, std::uint64_t records) {
  if (!m.ok) {
    std::fprintf(out, "  %-14s FAILED: %s\n", name, m.error);
    return;
  }
  std::fprintf(out, "  %-14s %9.2f %10.2f %12s", name, m.seconds,
               m.seconds > 0 ? static_cast<double>(records) / m.seconds / 1e6 : 0.0,
               Mib(static_cast<double>(m.peakRssBytes)).c_str());
  if (m.threads != 0) {
    std::fprintf(out, "   %u threads, %u runs, %u merge passes, %s temporary", m.threads, m.runs, m.mergePasses,
                 Mib(static_cast<double>(m.workFileBytes)).c_str());
  }
  std::fprintf(out, "\n");
}

bool Delivered(const Measurement& m, std::uint64_t records) {
  return m.ok && m.records == records && m.checksumIn == m.checksumOut;
}

}  // namespace

std::string Mib(double bytes) {
  char text[32];
  std::snprintf(text, sizeof text, "%.1f MiB", bytes / 1048576.0);
  return text;
}

void MeasureFileSort(const BenchConfig& config, Measurement& m) {
  ApplySettings(config);
  const std::vector<FileSort::SortKey> keys = WorkloadKeys(config.workload);
  OrderChecker checker(keys, config.values);
  FileSort::Statistics stats;
  const Clock::time_point start = Clock::now();
  std::uint64_t checksum = 0;
  try {
    GeneratedSort sort(config, keys, &stats, checker);
    if (config.memory != 0) {
      sort.SetMemoryTarget(static_cast<unsigned>(std::min<std::uint64_t>(config.memory, 0xFFFFFFFFull)));
    }
    if (config.announceRows) sort.SetNRows(static_cast<std::int64_t>(config.records));
    sort.Sort();
    checksum = sort.Checksum();
  } catch (const ErrorText& e) {
    m.Fail("the sort failed: " + e.Text());
    return;
  }
  Finish(m, checker, checksum, Since(start));
  m.threads = stats.threads;
  m.runs = static_cast<std::uint32_t>(stats.runs.size());
  m.mergePasses = static_cast<std::uint32_t>(stats.merges.size());
  m.workFileBytes = stats.workFileBytes;
  for (const FileSort::Statistics::MergeInfo& merge : stats.merges) m.workFileBytes += merge.bytes;
}

void MeasurePassThrough(const BenchConfig& config, Measurement& m) {
  const std::vector<FileSort::SortKey> keys = WorkloadKeys(config.workload);
  OrderChecker checker(keys, config.values);
  const RecordGenerator generator(config.workload, config.values);
  std::vector<OBS> record(config.values);
  const Clock::time_point start = Clock::now();
  std::uint64_t checksum = 0;
  for (std::uint64_t i = 0; i < config.records; ++i) {
    generator.Make(i, record.data());
    checksum += RecordHash(record.data(), config.values);
    checker.Put(record.data());
  }
  Finish(m, checker, checksum, Since(start));
}

void MeasureStableSort(const BenchConfig& config, Measurement& m) {
  static constexpr auto table = StableSortTable(std::make_index_sequence<kMaxValues - kMinValues + 1>());
  if (config.values < kMinValues || config.values > kMaxValues) {
    m.Fail("the stable_sort baseline takes records of " + std::to_string(kMinValues) + " to " +
           std::to_string(kMaxValues) + " values");
    return;
  }
  table[config.values - kMinValues](config, m);
}

void MeasureIoFloor(const BenchConfig& config, Measurement& m) {
  ApplySettings(config);
  const std::vector<FileSort::SortKey> keys = WorkloadKeys(config.workload);
  OrderChecker checker(keys, config.values);
  const RecordGenerator generator(config.workload, config.values);
  const std::size_t recordBytes = std::size_t{config.values} * sizeof(OBS);
  const std::size_t blockBytes = BlockBytes(recordBytes);
  std::vector<OBS> block(blockBytes / sizeof(OBS));
  char* bytes = reinterpret_cast<char*>(block.data());
  const std::string dir = vexahost::TempDirectory();
  const Clock::time_point start = Clock::now();
  const int fd = CreateScratchFile(dir);
  if (fd < 0) {
    m.Fail("cannot create a scratch file in " + dir);
    return;
  }
  struct Closer {
    int fd;
    ~Closer() {
#ifdef _WIN32
      _close(fd);
#else
      ::close(fd);
#endif
    }
  } closer{fd};
  std::uint64_t checksum = 0;
  std::size_t used = 0;
  for (std::uint64_t i = 0; i < config.records; ++i) {
    OBS* record = reinterpret_cast<OBS*>(bytes + used);
    generator.Make(i, record);
    checksum += RecordHash(record, config.values);
    used += recordBytes;
    if (used == blockBytes) {
      WriteAll(fd, bytes, used);
      used = 0;
    }
  }
  WriteAll(fd, bytes, used);
#ifdef _WIN32
  _lseeki64(fd, 0, SEEK_SET);
#else
  ::lseek(fd, 0, SEEK_SET);
#endif
  for (;;) {
    const std::size_t n = ReadSome(fd, bytes, blockBytes);
    for (std::size_t at = 0; at + recordBytes <= n; at += recordBytes) {
      checker.Put(reinterpret_cast<const OBS*>(bytes + at));
    }
    if (n < blockBytes) break;
  }
  Finish(m, checker, checksum, Since(start));
}

WorkloadResult RunWorkload(const BenchConfig& config, std::FILE* out) {
  WorkloadResult result;
  result.memoryTarget = std::max<std::uint64_t>(config.memory, 104857600);
  result.baselineRss = BaselineRssBytes();
  std::fprintf(out, "%s: %s\n", WorkloadName(config.workload), WorkloadDescription(config.workload));
  std::fprintf(out, "  %llu records of %u values (%u bytes), memory target %s, threads %s, best of %u\n",
               static_cast<unsigned long long>(config.records), config.values, config.values * 8,
               Mib(static_cast<double>(result.memoryTarget)).c_str(),
               config.threads ? std::to_string(config.threads).c_str() : "default", config.repeat);
  std::fprintf(out, "  %-14s %9s %10s %12s\n", "measurement", "seconds", "Mrec/s", "peak RSS");
  std::fflush(out);

  struct Entry {
    const char* name;
    void (*body)(const BenchConfig&, Measurement&);
    Measurement* slot;
  } entries[] = {{"FileSort", MeasureFileSort, &result.fileSort},
                 {"pass-through", MeasurePassThrough, &result.passThrough},
                 {"stable_sort", MeasureStableSort, &result.stableSort},
                 {"I/O floor", MeasureIoFloor, &result.ioFloor}};
  for (Entry& entry : entries) {
    for (unsigned r = 0; r < (config.repeat == 0 ? 1 : config.repeat); ++r) {
      const Measurement m = MeasureInChild([&](Measurement& into) { entry.body(config, into); });
      if (r == 0 || !entry.slot->ok || (m.ok && m.seconds < entry.slot->seconds)) *entry.slot = m;
    }
    PrintLine(out, entry.name, *entry.slot, config.records);
    std::fflush(out);
  }

  const Measurement& f = result.fileSort;
  result.correct = Delivered(f, config.records) && f.orderViolations == 0 && f.stabilityViolations == 0 &&
                   Delivered(result.passThrough, config.records) && Delivered(result.stableSort, config.records) &&
                   result.stableSort.orderViolations == 0 && Delivered(result.ioFloor, config.records);
  if (!Delivered(f, config.records)) {
    std::fprintf(out, "  CHECK FAILED: FileSort delivered %llu of %llu records%s\n",
                 static_cast<unsigned long long>(f.records), static_cast<unsigned long long>(config.records),
                 f.checksumIn != f.checksumOut ? " with a different checksum" : "");
  } else if (f.orderViolations != 0 || f.stabilityViolations != 0) {
    std::fprintf(out, "  CHECK FAILED: %llu records out of key order, %llu ties out of input order\n",
                 static_cast<unsigned long long>(f.orderViolations),
                 static_cast<unsigned long long>(f.stabilityViolations));
  } else {
    std::fprintf(out, "  check: FileSort output complete (checksum), in key order, ties in input order\n");
  }
  if (f.ok && result.stableSort.ok && result.ioFloor.ok) {
    const double vsStable = f.seconds / result.stableSort.seconds;
    const double vsFloor = f.seconds / result.ioFloor.seconds;
    const double above = static_cast<double>(f.peakRssBytes) - static_cast<double>(result.baselineRss);
    const double allowed = static_cast<double>(result.memoryTarget) + 40.0 * 1048576.0;
    const bool okStable = vsStable <= 0.7, okFloor = vsFloor <= 2.7, okRss = above <= allowed;
    std::fprintf(out, "  FileSort / stable_sort   %s  (target <= 0.70)  %s\n", Ratio(f.seconds, result.stableSort.seconds).c_str(),
                 okStable ? "met" : "NOT MET");
    std::fprintf(out, "  FileSort / I/O floor     %s  (target <= 2.70)  %s\n", Ratio(f.seconds, result.ioFloor.seconds).c_str(),
                 okFloor ? "met" : "NOT MET");
    std::fprintf(out, "  FileSort / pass-through  %s\n", Ratio(f.seconds, result.passThrough.seconds).c_str());
    std::fprintf(out, "  peak RSS - empty process %s = target %+.1f MiB  (target + 40 MiB at most)  %s\n",
                 Mib(above).c_str(), (above - static_cast<double>(result.memoryTarget)) / 1048576.0,
                 okRss ? "met" : "NOT MET");
    result.meetsTargets = okStable && okFloor && okRss;
  }
  std::fflush(out);
  return result;
}

}  // namespace sortbench
