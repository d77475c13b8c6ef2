// Command-line options of the subcommands: "--name value", "--name=value",
// "-x value", "-xvalue", flags without a value, positional arguments, "--"
// to end the options, and "-" as a positional (standard input or output).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace isortcli {

struct OptionDef {
  const char* longName;  // without the dashes; may be null
  char shortName;        // 0: none
  bool takesValue;
  int id;                // returned by Next(); must not be kPositional
};

class ArgParser {
 public:
  static constexpr int kPositional = 0;

  // `command` names the subcommand in messages ("sort").
  ArgParser(std::vector<std::string> args, std::vector<OptionDef> options, std::string command);

  // The next option (its id and value, empty for a flag) or positional
  // argument (kPositional). Returns false after the last. Throws UsageError
  // for an unknown option or a missing value.
  bool Next(int* id, std::string* value);
  // The option as the user spelled it, for messages ("-k", "--memory").
  const std::string& Spelling() const { return spelling_; }

 private:
  const OptionDef* FindLong(const std::string& name) const;
  const OptionDef* FindShort(char name) const;

  std::vector<std::string> args_;
  std::vector<OptionDef> options_;
  std::string command_;
  std::size_t next_ = 0;
  bool optionsEnded_ = false;
  std::string spelling_;
};

// "100M", "2G", "512k", "1048576": a byte count; K, M, G, T are powers of
// 1024, optionally followed by "B" or "iB". Throws UsageError naming `option`.
std::uint64_t ParseSize(const std::string& text, const std::string& option);
// A decimal count in [minimum, maximum]. Throws UsageError naming `option`.
std::uint64_t ParseCount(const std::string& text, const std::string& option, std::uint64_t minimum,
                         std::uint64_t maximum);

}  // namespace isortcli
