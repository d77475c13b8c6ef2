// The subcommands of the isort tool. Each takes the arguments after its
// name, returns the process's exit code (Errors.h) and throws UsageError or
// DataError, which main() reports.
#pragma once

#include <string>
#include <vector>

namespace isortcli {

int SortCommand(const std::vector<std::string>& args);
int GenCommand(const std::vector<std::string>& args);
int BenchCommand(const std::vector<std::string>& args, const std::string& self);

}  // namespace isortcli
