// VEXAWLIB: clocks, processor counts, value moves, the code table, ASSERT.
#include <algorithm>
#include <chrono>
#include <cstring>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "codec_core.h"
#include "hostinternal.h"
#include "isort/host/vexawlib.h"

#ifdef _WIN32
#include <windows.h>
#else
#include <ctime>
#include <fstream>
#include <sstream>
#endif

namespace {

// Wall-clock milliseconds count from the library's load, so the 32-bit
// wrap comes after 49 days of the process rather than of the machine.
const std::chrono::steady_clock::time_point g_start = std::chrono::steady_clock::now();

FortranInt Wrap(std::uint64_t milliseconds) {
  return static_cast<FortranInt>(static_cast<std::uint32_t>(milliseconds));
}

std::uint64_t ProcessCpuMilliseconds() {
#ifdef _WIN32
  FILETIME created, exited, kernel, user;
  if (!GetProcessTimes(GetCurrentProcess(), &created, &exited, &kernel, &user)) return 0;
  auto ticks = [](const FILETIME& t) {
    return (static_cast<std::uint64_t>(t.dwHighDateTime) << 32) | t.dwLowDateTime;
  };
  return (ticks(kernel) + ticks(user)) / 10000;  // 100 ns units
#else
  timespec t;
  if (clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &t) != 0) return 0;
  return static_cast<std::uint64_t>(t.tv_sec) * 1000 + static_cast<std::uint64_t>(t.tv_nsec) / 1000000;
#endif
}

unsigned int HardwareThreads() {
  unsigned int n = std::thread::hardware_concurrency();
  return n ? n : 1;
}

struct Topology {
  unsigned int packages = 0;
  unsigned int coresPerPackage = 0;
};

#ifdef _WIN32
Topology ReadTopology() {
  Topology t;
  DWORD bytes = 0;
  GetLogicalProcessorInformation(nullptr, &bytes);
  if (GetLastError() != ERROR_INSUFFICIENT_BUFFER || bytes == 0) return t;
  std::vector<SYSTEM_LOGICAL_PROCESSOR_INFORMATION> info(bytes / sizeof(SYSTEM_LOGICAL_PROCESSOR_INFORMATION) + 1);
  if (!GetLogicalProcessorInformation(info.data(), &bytes)) return t;
  unsigned int cores = 0;
  for (std::size_t i = 0; i < bytes / sizeof(SYSTEM_LOGICAL_PROCESSOR_INFORMATION); ++i) {
    if (info[i].Relationship == RelationProcessorPackage) ++t.packages;
    if (info[i].Relationship == RelationProcessorCore) ++cores;
  }
  if (t.packages) t.coresPerPackage = cores / t.packages;
  return t;
}
#else
bool ReadNumber(const std::string& path, long* value) {
  std::ifstream in(path);
  return static_cast<bool>(in >> *value);
}

// Distinct packages and (package, core) pairs from sysfs, else from
// /proc/cpuinfo.
Topology ReadTopology() {
  std::set<long> packages;
  std::set<std::pair<long, long>> cores;
  for (unsigned int cpu = 0; cpu < 4096; ++cpu) {
    const std::string base = "/sys/devices/system/cpu/cpu" + std::to_string(cpu) + "/topology/";
    long package, core;
    if (!ReadNumber(base + "physical_package_id", &package) ||
        !ReadNumber(base + "core_id", &core)) {
      if (cpu >= HardwareThreads()) break;
      continue;  // offline processors have no topology
    }
    packages.insert(package);
    cores.insert({package, core});
  }
  if (packages.empty()) {
    std::ifstream in("/proc/cpuinfo");
    std::string line;
    long package = -1;
    while (std::getline(in, line)) {
      const std::size_t colon = line.find(':');
      if (colon == std::string::npos) continue;
      const std::string key = line.substr(0, line.find_last_not_of(" \t", colon - 1) + 1);
      long value;
      if (!(std::istringstream(line.substr(colon + 1)) >> value)) continue;
      if (key == "physical id") {
        package = value;
        packages.insert(value);
      } else if (key == "core id" && package >= 0) {
        cores.insert({package, value});
      }
    }
  }
  Topology t;
  if (!packages.empty() && cores.size() >= packages.size()) {
    t.packages = static_cast<unsigned int>(packages.size());
    t.coresPerPackage = static_cast<unsigned int>(cores.size() / packages.size());
  }
  return t;
}
#endif

const Topology& MachineTopology() {
  static const Topology topology = [] {
    Topology t = ReadTopology();
    if (t.packages == 0 || t.coresPerPackage == 0) {
      t.packages = 1;
      t.coresPerPackage = HardwareThreads();
    }
    return t;
  }();
  return topology;
}

// Fortran passes text with its length; both copies are given, the one by
// address wins when present. Trailing blanks are padding.
std::string FortranText(const FortranInt* length, const char* text, FortranInt lengthValue) {
  FortranInt n = length ? *length : lengthValue;
  if (!text || n <= 0) return std::string();
  std::string s(text, static_cast<std::size_t>(n));
  s.erase(s.find_last_not_of(' ') + 1);
  return s;
}

}  // namespace

extern "C" {

void VEXA_STDCALL TIMTOT(FortranInt* first, FortranInt* second) {
  const auto wall = std::chrono::steady_clock::now() - g_start;
  if (first) *first = Wrap(ProcessCpuMilliseconds());
  if (second)
    *second = Wrap(static_cast<std::uint64_t>(
        std::chrono::duration_cast<std::chrono::milliseconds>(wall).count()));
}

unsigned int GETTHREADS() { return vexahost::internal::ThreadSetting(); }

unsigned int getPhysicalCPUCount() {
  unsigned int packages, cores;
  vexahost::internal::ProcessorCountSetting(&packages, &cores);
  return packages ? packages : MachineTopology().packages;
}

unsigned int getCoresPerPhysicalCPUCount() {
  unsigned int packages, cores;
  vexahost::internal::ProcessorCountSetting(&packages, &cores);
  return cores ? cores : MachineTopology().coresPerPackage;
}

void VEXA_STDCALL OBMOVE(const OBS* from, OBS* to, const FortranInt* n) {
  if (n && *n > 0) std::memcpy(to, from, static_cast<std::size_t>(*n) * sizeof(OBS));
}

// Filled by the codec's own table generator, so the two never disagree.
const std::uint32_t IEEEPart1[256] = {
#define V(c) vexahost::codec::kTables.high[c]
#define V8(c) V(c), V(c + 1), V(c + 2), V(c + 3), V(c + 4), V(c + 5), V(c + 6), V(c + 7)
#define V64(c) V8(c), V8(c + 8), V8(c + 16), V8(c + 24), V8(c + 32), V8(c + 40), V8(c + 48), V8(c + 56)
    V64(0), V64(64), V64(128), V64(192)
#undef V64
#undef V8
#undef V
};

void VEXA_STDCALL ASSERT(const FortranInt* nameLength, const char* name, FortranInt nameLengthValue,
                         const FortranInt* textLength, const char* text,
                         FortranInt textLengthValue) {
  try {
    vexahost::internal::Report("ASSERT in " + FortranText(nameLength, name, nameLengthValue) +
                               ": " + FortranText(textLength, text, textLengthValue));
  } catch (...) {
    // Out of memory while building the text: nothing better to report with.
  }
}

}  // extern "C"
