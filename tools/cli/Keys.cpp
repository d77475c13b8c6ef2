#include "Keys.h"

#include <charconv>
#include <cfloat>
#include <cmath>
#include <cstring>

#include "Errors.h"
#include "host/hostsettings.h"

namespace isortcli {
namespace {

bool AllDigits(const std::string& s) {
  if (s.empty()) return false;
  for (char c : s) {
    if (c < '0' || c > '9') return false;
  }
  return true;
}

bool IsTypeText(const std::string& s) {
  if (s == "n") return true;
  if (s.empty() || s[0] != 's') return false;
  for (std::size_t i = 1; i < s.size(); ++i) {
    if (s[i] < '0' || s[i] > '9') return false;
  }
  return true;
}

}  // namespace

KeySpec ParseKeySpec(const std::string& text) {
  KeySpec key;
  key.text = text;
  std::string rest = text;
  // Suffixes are taken from the right, so a column name may hold ':'.
  std::size_t colon = rest.rfind(':');
  if (colon != std::string::npos) {
    const std::string last = rest.substr(colon + 1);
    if (last == "asc" || last == "desc") {
      key.direction = last == "desc" ? -1 : 1;
      rest.erase(colon);
      colon = rest.rfind(':');
    }
  }
  if (colon != std::string::npos) {
    const std::string type = rest.substr(colon + 1);
    if (IsTypeText(type)) {
      if (type == "n") {
        key.numeric = true;
      } else if (type.size() > 1) {
        if (type.size() > 10) throw UsageError("bad key '" + text + "': string width too large");
        const unsigned long long width = std::stoull(type.substr(1));
        if (width == 0 || width > 0x7FFFFFFFull) {
          throw UsageError("bad key '" + text + "': a string width must be from 1 to 2147483647");
        }
        key.width = static_cast<std::uint32_t>(width);
      }
      rest.erase(colon);
    }
  }
  if (rest.empty()) {
    throw UsageError("bad key '" + text + "': no column (use COLUMN[:n|:sW][:asc|:desc])");
  }
  key.column = rest;
  return key;
}

void ResolveColumns(std::vector<KeySpec>& keys, const std::vector<std::string>* header) {
  for (KeySpec& key : keys) {
    bool found = false;
    if (header) {
      for (std::size_t i = 0; i < header->size(); ++i) {
        if ((*header)[i] == key.column) {
          key.index = static_cast<unsigned>(i);
          key.label = "column " + std::to_string(i + 1) + " (" + key.column + ")";
          found = true;
          break;
        }
      }
    }
    if (found) continue;
    if (!AllDigits(key.column) || key.column.size() > 9 || std::stoul(key.column) == 0) {
      std::string message = "unknown column '" + key.column + "' in key '" + key.text + "'";
      if (!header) {
        message += ": without a header, columns are numbers from 1";
      } else {
        message += " (the header has:";
        for (std::size_t i = 0; i < header->size() && i < 20; ++i) message += " " + (*header)[i];
        if (header->size() > 20) message += " ...";
        message += ")";
      }
      if (key.column.find(':') != std::string::npos) message += "; a key is COLUMN[:n|:sW][:asc|:desc]";
      throw UsageError(message);
    }
    const unsigned long number = std::stoul(key.column);
    if (header && number > header->size()) {
      throw UsageError("unknown column " + key.column + " in key '" + key.text + "': the header has " +
                       std::to_string(header->size()) + " columns");
    }
    key.index = static_cast<unsigned>(number - 1);
    key.label = "column " + key.column;
    if (header) key.label += " (" + (*header)[key.index] + ")";
  }
}

void ResolveValues(std::vector<KeySpec>& keys, unsigned nvars) {
  for (KeySpec& key : keys) {
    if (!AllDigits(key.column) || key.column.size() > 9 || std::stoul(key.column) == 0) {
      throw UsageError("bad key '" + key.text + "': binary records take keys by value number, from 1 to " +
                       std::to_string(nvars));
    }
    const unsigned long number = std::stoul(key.column);
    if (!key.numeric && key.width == 0) key.width = 8;
    const unsigned long step = KeyStep(key);
    if (number > nvars || number - 1 + step > nvars) {
      throw UsageError("bad key '" + key.text + "': it reaches past the record of " + std::to_string(nvars) +
                       " values");
    }
    key.index = static_cast<unsigned>(number - 1);
    key.label = "value " + key.column;
  }
}

unsigned KeyStep(const KeySpec& key) {
  if (key.numeric || key.width <= 8) return 1;
  return (key.width + 7) / 8;
}

bool ParseNumber(const char* text, std::size_t size, double* value, bool* empty) {
  const char* p = text;
  const char* end = text + size;
  while (p < end && (*p == ' ' || *p == '\t')) ++p;
  while (end > p && (end[-1] == ' ' || end[-1] == '\t')) --end;
  *empty = p == end;
  if (p == end) return false;
  if (*p == '+' && end - p > 1) ++p;
  double d = 0;
  const std::from_chars_result r = std::from_chars(p, end, d, std::chars_format::general);
  if (r.ec != std::errc() || r.ptr != end || std::isnan(d)) return false;
  // The missing value is the lowest there is: -inf sorts with it.
  *value = d < -DBL_MAX ? -DBL_MAX : d;
  return true;
}

KeyExtractor::KeyExtractor(const std::vector<KeySpec>& keys, std::string inputName)
    : keys_(keys), inputName_(std::move(inputName)) {
  std::memcpy(&missing_, vexahost::SystemMissing(), sizeof missing_);
  for (std::size_t i = 0; i < keys_.size(); ++i) {
    const KeySpec& key = keys_[i];
    slots_.push_back(Slot{key.index, values_, key.numeric ? 0u : key.width, i});
    values_ += KeyStep(key);
    if (key.index + 1 > wanted_) wanted_ = key.index + 1;
  }
}

std::vector<FileSort::SortKey> KeyExtractor::SortKeys() const {
  std::vector<FileSort::SortKey> result;
  for (const Slot& slot : slots_) {
    result.push_back(FileSort::SortKey{static_cast<std::int32_t>(slot.first), keys_[slot.key].direction,
                                       slot.width});
  }
  return result;
}

void KeyExtractor::TooWide(const CsvRow& row, const Slot& slot, std::size_t size) const {
  const KeySpec& key = keys_[slot.key];
  // The field's own line: the row's first line plus the line feeds before it.
  std::uint64_t line = row.line;
  const FieldRef& field = row.fields[slot.column];
  for (const char* p = row.data; p < field.data; ++p) line += *p == '\n';
  throw DataError(inputName_ + ": line " + std::to_string(line) + ", " + key.label + ": a value of " +
                  std::to_string(size) + " bytes is wider than the key's width of " + std::to_string(slot.width) +
                  " (key '" + key.text + "'; use :s" + std::to_string(size) +
                  " or more, or :s for the widest value)");
}

void KeyExtractor::Extract(const CsvRow& row, OBS* values) {
  for (const Slot& slot : slots_) {
    OBS* out = values + slot.first;
    const bool present = slot.column < row.fieldCount;
    std::size_t size = 0;
    const char* text = present ? FieldValue(row.fields[slot.column], scratch_, &size) : "";
    if (slot.width == 0) {
      double d;
      bool empty;
      if (ParseNumber(text, size, &d, &empty)) {
        std::memcpy(out, &d, sizeof d);
      } else {
        if (!empty) ++unparsable_;
        std::memcpy(out, &missing_, sizeof missing_);
      }
    } else {
      if (size > slot.width) TooWide(row, slot, size);
      const std::size_t bytes = (slot.width <= 8 ? 1u : (slot.width + 7) / 8) * 8u;
      char* dst = reinterpret_cast<char*>(out);
      std::memcpy(dst, text, size);
      std::memset(dst + size, 0, bytes - size);
    }
  }
}

}  // namespace isortcli
