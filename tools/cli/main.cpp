// isort: sorts tables too big to sort comfortably in memory.
//
//   isort sort [options] [INPUT] [-o OUTPUT]   sort a CSV/TSV table or binary records
//   isort gen [options]                        write a sample table
//   isort bench [options]                      measure the sort against baselines
#include <cstdio>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "Commands.h"
#include "Errors.h"
#include "isort/host/errhub.h"

namespace {

const char kHelp[] =
    "usage: isort COMMAND [options]\n"
    "\n"
    "Commands:\n"
    "  sort    sort a CSV or TSV table, or binary records, by typed keys\n"
    "  gen     write a sample table (survey-like CSV or binary records)\n"
    "  bench   measure the sort beside its baselines and GNU-style sort\n"
    "\n"
    "'isort COMMAND --help' describes a command's options.\n"
    "Example: isort sort -k region -k income:n:desc survey.csv -o sorted.csv\n";

void Report(const std::string& message) { std::fprintf(stderr, "isort: %s\n", message.c_str()); }

}  // namespace

int main(int argc, char** argv) {
  using namespace isortcli;
  std::vector<std::string> args(argv + 1, argv + argc);
  if (args.empty() || args[0] == "--help" || args[0] == "-h" || args[0] == "help") {
    std::fputs(kHelp, args.empty() ? stderr : stdout);
    return args.empty() ? kExitUsage : kExitOk;
  }
  const std::string command = args[0];
  args.erase(args.begin());
  try {
    if (command == "sort") return SortCommand(args);
    if (command == "gen") return GenCommand(args);
    if (command == "bench") return BenchCommand(args, argv[0]);
    throw UsageError("unknown command '" + command + "' (commands: sort, gen, bench)");
  } catch (const UsageError& e) {
    Report(e.what());
    return kExitUsage;
  } catch (const DataError& e) {
    Report(e.what());
  } catch (const ErrorText& e) {
    Report(e.Text());
  } catch (const std::bad_alloc&) {
    Report("out of memory (a smaller --memory target may help)");
  } catch (const std::exception& e) {
    Report(e.what());
  }
  return kExitFailure;
}
