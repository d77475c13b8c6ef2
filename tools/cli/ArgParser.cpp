#include "ArgParser.h"

#include <cstring>

#include "Errors.h"

namespace isortcli {

ArgParser::ArgParser(std::vector<std::string> args, std::vector<OptionDef> options, std::string command)
    : args_(std::move(args)), options_(std::move(options)), command_(std::move(command)) {}

const OptionDef* ArgParser::FindLong(const std::string& name) const {
  for (const OptionDef& option : options_) {
    if (option.longName && name == option.longName) return &option;
  }
  return nullptr;
}

const OptionDef* ArgParser::FindShort(char name) const {
  for (const OptionDef& option : options_) {
    if (option.shortName != 0 && option.shortName == name) return &option;
  }
  return nullptr;
}

bool ArgParser::Next(int* id, std::string* value) {
  if (next_ >= args_.size()) return false;
  const std::string arg = args_[next_++];
  spelling_ = arg;
  const std::string help = " (see 'isort " + command_ + " --help')";
  if (optionsEnded_ || arg.size() < 2 || arg[0] != '-') {
    *id = kPositional;
    *value = arg;
    return true;
  }
  if (arg == "--") {
    optionsEnded_ = true;
    return Next(id, value);
  }
  const OptionDef* option = nullptr;
  std::string attached;
  bool hasAttached = false;
  if (arg[1] == '-') {
    const std::size_t eq = arg.find('=');
    const std::string name = arg.substr(2, eq == std::string::npos ? std::string::npos : eq - 2);
    option = FindLong(name);
    spelling_ = "--" + name;
    if (!option) throw UsageError("unknown option '" + spelling_ + "'" + help);
    if (eq != std::string::npos) {
      attached = arg.substr(eq + 1);
      hasAttached = true;
    }
  } else {
    option = FindShort(arg[1]);
    spelling_ = arg.substr(0, 2);
    if (!option) throw UsageError("unknown option '" + spelling_ + "'" + help);
    if (arg.size() > 2) {
      attached = arg.substr(2);
      hasAttached = true;
    }
  }
  *id = option->id;
  if (!option->takesValue) {
    if (hasAttached) throw UsageError("option '" + spelling_ + "' takes no value" + help);
    value->clear();
    return true;
  }
  if (hasAttached) {
    *value = attached;
  } else {
    if (next_ >= args_.size()) throw UsageError("option '" + spelling_ + "' needs a value" + help);
    *value = args_[next_++];
  }
  return true;
}

std::uint64_t ParseSize(const std::string& text, const std::string& option) {
  const std::string bad = "bad size '" + text + "' for " + option +
                          " (examples: 100M, 2G, 1048576)";
  std::size_t i = 0;
  std::uint64_t n = 0;
  while (i < text.size() && text[i] >= '0' && text[i] <= '9') {
    const std::uint64_t digit = static_cast<std::uint64_t>(text[i] - '0');
    if (n > (UINT64_MAX - digit) / 10) throw UsageError(bad);
    n = n * 10 + digit;
    ++i;
  }
  if (i == 0) throw UsageError(bad);
  std::string suffix = text.substr(i);
  for (char& c : suffix) {
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  }
  int shift = 0;
  if (!suffix.empty()) {
    const char* units = "KMGT";
    const char* at = std::strchr(units, suffix[0]);
    if (at && *at) {
      shift = 10 * static_cast<int>(at - units + 1);
      suffix.erase(0, 1);
    }
    if (!(suffix.empty() || suffix == "B" || (shift != 0 && suffix == "IB"))) throw UsageError(bad);
  }
  if (shift != 0 && n > (UINT64_MAX >> shift)) throw UsageError(bad);
  return n << shift;
}

std::uint64_t ParseCount(const std::string& text, const std::string& option, std::uint64_t minimum,
                         std::uint64_t maximum) {
  std::uint64_t n = 0;
  bool ok = !text.empty();
  for (char c : text) {
    if (c < '0' || c > '9' || n > (UINT64_MAX - 9) / 10) {
      ok = false;
      break;
    }
    n = n * 10 + static_cast<std::uint64_t>(c - '0');
  }
  // Allow the readable suffixes of row counts: 10M, 2k.
  if (!ok && !text.empty()) {
    const char last = text.back();
    std::uint64_t scale = last == 'k' || last == 'K' ? 1000 : last == 'M' ? 1000000 : last == 'G' ? 1000000000 : 0;
    if (scale != 0 && text.size() > 1) {
      const std::uint64_t base = ParseCount(text.substr(0, text.size() - 1), option, 0, UINT64_MAX / scale);
      n = base * scale;
      ok = true;
    }
  }
  if (!ok || n < minimum || n > maximum) {
    throw UsageError("bad value '" + text + "' for " + option + " (a whole number from " +
                     std::to_string(minimum) + " to " + std::to_string(maximum) + ")");
  }
  return n;
}

}  // namespace isortcli
