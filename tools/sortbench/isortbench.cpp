// isortbench: the sort engine's benchmark (workloads in Workloads.h, the
// measurements in Bench.h).
//
//   isortbench [--workload W1,W2,W3] [--records 2M,10M] [--values 10]
//              [--memory SIZE] [--threads N] [--repeat R] [--tmpdir DIR]
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "Bench.h"

namespace {

const char kHelp[] =
    "usage: isortbench [options]\n"
    "\n"
    "Measures the external sort beside a pass-through floor, an in-memory\n"
    "std::stable_sort and an I/O floor, each in a process of its own.\n"
    "\n"
    "  --workload LIST   W1, W2, W3, comma-separated (default W1,W2,W3)\n"
    "  --records LIST    record counts, comma-separated (default 2M,10M)\n"
    "  --values N        values per record, 2 to 32 (default 10)\n"
    "  --memory SIZE     the sort's memory target (default its own, 100 MiB)\n"
    "  --threads N       the host's thread setting (default the machine's)\n"
    "  --repeat R        best of R runs of each measurement (default 1)\n"
    "  --announce-rows 1 tell the sort the record count first (SetNRows): an\n"
    "                    input that fits the memory target then uses one thread\n"
    "  --tmpdir DIR      directory of temporary files\n";

bool ParseNumber(const std::string& text, std::uint64_t* n, bool sizes) {
  char* end = nullptr;
  const double v = std::strtod(text.c_str(), &end);
  if (end == text.c_str() || v < 0) return false;
  double scale = 1;
  const std::string suffix(end);
  if (suffix == "k" || suffix == "K") {
    scale = sizes ? 1024.0 : 1e3;
  } else if (suffix == "M" || suffix == "m") {
    scale = sizes ? 1048576.0 : 1e6;
  } else if (suffix == "G" || suffix == "g") {
    scale = sizes ? 1073741824.0 : 1e9;
  } else if (!suffix.empty()) {
    return false;
  }
  *n = static_cast<std::uint64_t>(v * scale + 0.5);
  return true;
}

std::vector<std::string> Split(const std::string& text) {
  std::vector<std::string> parts;
  std::size_t start = 0;
  while (start <= text.size()) {
    const std::size_t comma = text.find(',', start);
    const std::size_t end = comma == std::string::npos ? text.size() : comma;
    if (end > start) parts.push_back(text.substr(start, end - start));
    if (comma == std::string::npos) break;
    start = comma + 1;
  }
  return parts;
}

int Usage(const std::string& message) {
  std::fprintf(stderr, "isortbench: %s (see --help)\n", message.c_str());
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  using namespace sortbench;
  std::vector<Workload> workloads = {Workload::W1, Workload::W2, Workload::W3};
  std::vector<std::uint64_t> sizes = {2000000, 10000000};
  BenchConfig base;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    std::string value;
    const std::size_t eq = arg.find('=');
    if (eq != std::string::npos) {
      value = arg.substr(eq + 1);
      arg.erase(eq);
    } else if (arg != "--help" && arg != "-h") {
      if (i + 1 >= argc) return Usage("option " + arg + " needs a value");
      value = argv[++i];
    }
    std::uint64_t n = 0;
    if (arg == "--help" || arg == "-h") {
      std::fputs(kHelp, stdout);
      return 0;
    } else if (arg == "--workload") {
      workloads.clear();
      for (const std::string& name : Split(value)) {
        Workload w;
        if (!ParseWorkload(name, &w)) return Usage("unknown workload '" + name + "'");
        workloads.push_back(w);
      }
    } else if (arg == "--records") {
      sizes.clear();
      for (const std::string& part : Split(value)) {
        if (!ParseNumber(part, &n, false) || n == 0) return Usage("bad record count '" + part + "'");
        sizes.push_back(n);
      }
    } else if (arg == "--values") {
      if (!ParseNumber(value, &n, false) || n < kMinValues || n > kMaxValues) return Usage("bad --values");
      base.values = static_cast<unsigned>(n);
    } else if (arg == "--memory") {
      if (!ParseNumber(value, &n, true) || n > 0xFFFFFFFFull) return Usage("bad --memory");
      base.memory = n;
    } else if (arg == "--threads") {
      if (!ParseNumber(value, &n, false) || n == 0 || n > 1024) return Usage("bad --threads");
      base.threads = static_cast<unsigned>(n);
    } else if (arg == "--repeat") {
      if (!ParseNumber(value, &n, false) || n == 0 || n > 100) return Usage("bad --repeat");
      base.repeat = static_cast<unsigned>(n);
    } else if (arg == "--tmpdir") {
      base.tmpdir = value;
    } else if (arg == "--announce-rows") {
      base.announceRows = value != "0";
    } else {
      return Usage("unknown option '" + arg + "'");
    }
  }
  bool allCorrect = true, allTargets = true;
  for (Workload w : workloads) {
    if (base.values < MinimumValues(w)) {
      return Usage(std::string(WorkloadName(w)) + " needs at least " + std::to_string(MinimumValues(w)) + " values");
    }
  }
  for (std::uint64_t records : sizes) {
    for (Workload w : workloads) {
      BenchConfig config = base;
      config.workload = w;
      config.records = records;
      const WorkloadResult r = RunWorkload(config, stdout);
      allCorrect = allCorrect && r.correct;
      allTargets = allTargets && r.meetsTargets;
      std::printf("\n");
    }
  }
  std::printf("%s; %s\n", allCorrect ? "all outputs checked" : "SOME OUTPUTS FAILED THEIR CHECK",
              allTargets ? "every target met" : "some targets not met");
  return allCorrect ? 0 : 1;
}
