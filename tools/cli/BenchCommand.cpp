// isort bench: the engine workloads W1 and W2 (Bench.h) and the tool's own
// workload: a generated survey CSV sorted by a string column (region) and a
// numeric column (income), beside the tool's pass-through floor (the same
// file read, parsed and written unsorted) and GNU-style `sort` with LC_ALL=C
// and the equivalent keys, -S at the same memory target, --parallel=2.
// Every measurement runs in a process of its own, in the same run.
#include <climits>
#include <cstdio>
#include <cstring>

#include "ArgParser.h"
#include "Bench.h"
#include "Commands.h"
#include "CsvReader.h"
#include "Errors.h"
#include "Keys.h"
#include "Stats.h"
#include "SysIo.h"
#include "host/hostsettings.h"

#ifndef _WIN32
#include <sys/stat.h>
#include <unistd.h>
#endif

namespace isortcli {
namespace {

const char kBenchHelp[] =
    "usage: isort bench [options]\n"
    "\n"
    "Measures, in one run and each in a process of its own:\n"
    "  - the sort library on the workloads W1 and W2 (see isortbench) beside its\n"
    "    pass-through floor, an in-memory std::stable_sort and an I/O floor;\n"
    "  - 'isort sort' on a generated CSV sorted by region (string) and income\n"
    "    (numeric), beside its pass-through floor and 'sort' (LC_ALL=C, -t, -s,\n"
    "    -k2,2 -k6,6n, -S, --parallel=2).\n"
    "\n"
    "  --workload LIST   engine workloads, comma-separated, or 'none' (default W1,W2)\n"
    "  --records LIST    engine record counts (default 2M,10M)\n"
    "  --csv-rows LIST   CSV sizes in rows, or 'none' (default 1M,10M)\n"
    "  -m, --memory SIZE memory target of every sort (default 100M)\n"
    "  -j, --threads N   threads of the sorts (default 2)\n"
    "  --repeat R        best of R runs of each measurement (default 1)\n"
    "  --dir DIR         where the CSV files go (default: the temporary directory)\n";

std::vector<std::string> SplitList(const std::string& text) {
  std::vector<std::string> parts;
  std::size_t start = 0;
  for (;;) {
    const std::size_t comma = text.find(',', start);
    const std::string part = text.substr(start, comma == std::string::npos ? std::string::npos : comma - start);
    if (!part.empty()) parts.push_back(part);
    if (comma == std::string::npos) break;
    start = comma + 1;
  }
  return parts;
}

std::string SelfPath(const std::string& argv0) {
#ifndef _WIN32
  char path[4096];
  const ssize_t n = ::readlink("/proc/self/exe", path, sizeof path - 1);
  if (n > 0) return std::string(path, static_cast<std::size_t>(n));
#endif
  return argv0;
}

// Checks a sorted survey CSV: rows in (region, income) order, missing
// incomes lowest, ties in increasing case id, and `rows` rows in all.
std::string CheckSortedSurvey(const std::string& path, std::uint64_t rows) {
  FileHandle in = FileHandle::OpenRead(path);
  CsvReader reader(in, CsvFormat());
  CsvRow row;
  if (!reader.Next(row, UINT_MAX)) return "the output is empty";
  std::string prevRegion, scratch;
  double prevIncome = 0, prevId = 0;
  std::uint64_t n = 0;
  while (reader.Next(row, 6)) {
    if (row.fieldCount < 6) return "line " + std::to_string(row.line) + " has fewer than 6 fields";
    std::size_t size;
    const char* text = FieldValue(row.fields[1], scratch, &size);
    std::string region(text, size);
    double income = -1.7976931348623157e308, id = 0;
    bool empty;
    text = FieldValue(row.fields[5], scratch, &size);
    ParseNumber(text, size, &income, &empty);
    text = FieldValue(row.fields[0], scratch, &size);
    ParseNumber(text, size, &id, &empty);
    if (n != 0) {
      const int c = region.compare(prevRegion);
      if (c < 0 || (c == 0 && income < prevIncome)) return "line " + std::to_string(row.line) + " is out of order";
      if (c == 0 && income == prevIncome && id < prevId) return "line " + std::to_string(row.line) + ": a tie out of input order";
    }
    prevRegion.swap(region);
    prevIncome = income;
    prevId = id;
    ++n;
  }
  if (n != rows) return std::to_string(n) + " rows instead of " + std::to_string(rows);
  return "";
}

std::uint64_t FileBytes(const std::string& path) {
  FileHandle in = FileHandle::OpenRead(path);
  const std::int64_t size = in.RegularSize();
  return size < 0 ? 0 : static_cast<std::uint64_t>(size);
}

struct Timed {
  sortbench::CommandResult best;
  bool ok = false;
};

Timed RunBest(const std::vector<std::string>& argv, const std::vector<std::string>& env,
              const std::string& errPath, unsigned repeat) {
  Timed t;
  for (unsigned r = 0; r < repeat; ++r) {
    const sortbench::CommandResult c = sortbench::MeasureCommand(argv, env, "", errPath);
    const bool ok = c.error.empty() && c.exitCode == 0;
    if (!t.ok || (ok && c.seconds < t.best.seconds)) {
      if (ok || !t.ok) t.best = c;
      t.ok = t.ok || ok;
    }
  }
  return t;
}

void PrintTimed(const char* name, const Timed& t, std::uint64_t rows, const std::string& errPath) {
  if (!t.ok) {
    std::string why = t.best.error;
    if (why.empty()) {
      why = "exit code " + std::to_string(t.best.exitCode);
      std::FILE* f = std::fopen(errPath.c_str(), "r");
      if (f) {
        char line[512];
        if (std::fgets(line, sizeof line, f)) {
          why += ": ";
          why += line;
          if (!why.empty() && why.back() == '\n') why.pop_back();
        }
        std::fclose(f);
      }
    }
    std::printf("  %-22s FAILED: %s\n", name, why.c_str());
    return;
  }
  std::printf("  %-22s %9.2f %10.2f %12s\n", name, t.best.seconds,
              static_cast<double>(rows) / t.best.seconds / 1e6,
              sortbench::Mib(static_cast<double>(t.best.peakRssBytes)).c_str());
}

bool CsvWorkload(const std::string& self, const std::string& dir, std::uint64_t rows, std::uint64_t memory,
                 unsigned threads, unsigned repeat) {
  const std::string tag = std::to_string(rows);
  const std::string input = dir + "/survey-" + tag + ".csv";
  const std::string output = dir + "/sorted-" + tag + ".csv";
  const std::string errors = dir + "/stderr-" + tag + ".txt";
  const std::string mem = std::to_string(memory);
  const std::string mib = std::to_string(memory / 1048576) + "M";
  const std::string jobs = std::to_string(threads);
  std::printf("CSV: %s rows of a survey table sorted by region (string) then income (numeric)\n",
              Grouped(rows).c_str());
  std::fflush(stdout);
  const sortbench::CommandResult gen =
      sortbench::MeasureCommand({self, "gen", "--rows", tag, "--seed", "7", "-o", input}, {}, "", errors);
  if (!gen.error.empty() || gen.exitCode != 0) {
    std::printf("  generating the input FAILED\n");
    return false;
  }
  const std::uint64_t bytes = FileBytes(input);
  std::printf("  input %s (%s), generated in %.2f s; memory target %s, %u threads, best of %u\n",
              input.c_str(), ShortBytes(static_cast<double>(bytes)).c_str(), gen.seconds,
              sortbench::Mib(static_cast<double>(memory)).c_str(), threads, repeat);
  std::printf("  %-22s %9s %10s %12s\n", "measurement", "seconds", "Mrows/s", "peak RSS");

  const std::vector<std::string> sortArgs = {self, "sort", "-k", "region", "-k", "income:n", "-m", mem,
                                             "-j", jobs, "-T", dir, "--quiet", input, "-o", output};
  const Timed isort = RunBest(sortArgs, {}, errors, repeat);
  PrintTimed("isort sort", isort, rows, errors);
  std::string check = isort.ok ? CheckSortedSurvey(output, rows) : "";
  if (isort.ok && FileBytes(output) != bytes) check = "the output's size differs from the input's";

  const Timed floor = RunBest({self, "sort", "--pass-through", "-k", "region", "-k", "income:n", "--quiet", input,
                               "-o", output},
                              {}, errors, repeat);
  PrintTimed("pass-through floor", floor, rows, errors);

  const Timed gnu = RunBest({"sort", "-t", ",", "-s", "-k2,2", "-k6,6n", "-S", mib, "--parallel=2", "-T", dir,
                             "-o", output, input},
                            {"LC_ALL=C"}, errors, repeat);
  PrintTimed("sort (LC_ALL=C)", gnu, rows, errors);
  std::remove(output.c_str());
  std::remove(input.c_str());
  std::remove(errors.c_str());

  bool pass = isort.ok && check.empty();
  std::printf("  check: %s\n", !isort.ok ? "isort failed" : check.empty() ? "isort's output is complete and in order, ties in input order" : ("FAILED: " + check).c_str());
  if (isort.ok && floor.ok) {
    const double r = isort.best.seconds / floor.best.seconds;
    std::printf("  isort / pass-through   %.2f  (target <= 3.00)  %s\n", r, r <= 3.0 ? "met" : "NOT MET");
  }
  if (isort.ok && gnu.ok) {
    const double r = gnu.best.seconds / isort.best.seconds;
    std::printf("  sort / isort           %.2f  (target >= 4.00)  %s\n", r, r >= 4.0 ? "met" : "NOT MET");
  }
  if (isort.ok) {
    const double limit = 1.25 * static_cast<double>(memory) + 50.0 * 1048576.0;
    const double peak = static_cast<double>(isort.best.peakRssBytes);
    std::printf("  isort peak RSS         %s  (1.25 x target + 50 MiB = %s)  %s\n", sortbench::Mib(peak).c_str(),
                sortbench::Mib(limit).c_str(), peak <= limit ? "met" : "NOT MET");
  }
  std::printf("\n");
  std::fflush(stdout);
  return pass;
}

}  // namespace

int BenchCommand(const std::vector<std::string>& args, const std::string& argv0) {
  enum { kWorkload = 1, kRecords, kCsvRows, kMemory, kThreads, kRepeat, kDir, kHelp };
  ArgParser parser(args,
                   {{"workload", 0, true, kWorkload},
                    {"records", 0, true, kRecords},
                    {"csv-rows", 0, true, kCsvRows},
                    {"memory", 'm', true, kMemory},
                    {"threads", 'j', true, kThreads},
                    {"repeat", 0, true, kRepeat},
                    {"dir", 0, true, kDir},
                    {"help", 'h', false, kHelp}},
                   "bench");
  std::vector<sortbench::Workload> workloads = {sortbench::Workload::W1, sortbench::Workload::W2};
  std::vector<std::uint64_t> records = {2000000, 10000000};
  std::vector<std::uint64_t> csvRows = {1000000, 10000000};
  std::uint64_t memory = 104857600;
  unsigned threads = 2, repeat = 1;
  std::string dir;
  int id;
  std::string value;
  while (parser.Next(&id, &value)) {
    switch (id) {
      case ArgParser::kPositional:
        throw UsageError("unexpected argument '" + value + "'");
      case kWorkload:
        workloads.clear();
        if (value == "none") break;
        for (const std::string& name : SplitList(value)) {
          sortbench::Workload w;
          if (!sortbench::ParseWorkload(name, &w)) throw UsageError("unknown workload '" + name + "' (W1, W2, W3)");
          workloads.push_back(w);
        }
        break;
      case kRecords:
        records.clear();
        for (const std::string& n : SplitList(value)) records.push_back(ParseCount(n, parser.Spelling(), 1, UINT64_MAX / 2));
        break;
      case kCsvRows:
        csvRows.clear();
        if (value == "none") break;
        for (const std::string& n : SplitList(value)) csvRows.push_back(ParseCount(n, parser.Spelling(), 1, UINT64_MAX / 2));
        break;
      case kMemory:
        memory = ParseSize(value, parser.Spelling());
        if (memory < 104857600) memory = 104857600;
        if (memory > 0xFFFFFFFFull) memory = 0xFFFFFFFFull;
        break;
      case kThreads:
        threads = static_cast<unsigned>(ParseCount(value, parser.Spelling(), 1, 1024));
        break;
      case kRepeat:
        repeat = static_cast<unsigned>(ParseCount(value, parser.Spelling(), 1, 100));
        break;
      case kDir:
        dir = value;
        break;
      case kHelp:
        std::fputs(kBenchHelp, stdout);
        return kExitOk;
    }
  }
  bool correct = true;
  for (std::uint64_t n : records) {
    for (sortbench::Workload w : workloads) {
      sortbench::BenchConfig config;
      config.workload = w;
      config.records = n;
      config.memory = memory;
      config.threads = threads;
      config.repeat = repeat;
      const sortbench::WorkloadResult r = sortbench::RunWorkload(config, stdout);
      correct = correct && r.correct;
      std::printf("\n");
    }
  }
  if (!csvRows.empty()) {
    const std::string self = SelfPath(argv0);
    std::string base = dir.empty() ? vexahost::TempDirectory() : dir;
#ifdef _WIN32
    const std::string work = base;
#else
    const std::string work = base + "/isort-bench-" + std::to_string(::getpid());
    if (::mkdir(work.c_str(), 0700) != 0) throw DataError("cannot create '" + work + "': " + SystemErrorText(errno));
#endif
    for (std::uint64_t n : csvRows) correct = CsvWorkload(self, work, n, memory, threads, repeat) && correct;
#ifndef _WIN32
    ::rmdir(work.c_str());
#endif
  }
  std::printf("%s\n", correct ? "all outputs checked" : "SOME OUTPUTS FAILED THEIR CHECK");
  return correct ? kExitOk : kExitFailure;
}

}  // namespace isortcli
