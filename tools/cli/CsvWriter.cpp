#include "CsvWriter.h"

#include <cstring>

namespace isortcli {

void AppendField(std::string& line, const char* data, std::size_t size, char delimiter) {
  bool quote = false;
  for (std::size_t i = 0; i < size && !quote; ++i) {
    const char c = data[i];
    quote = c == delimiter || c == '"' || c == '\n' || c == '\r';
  }
  if (!quote) {
    line.append(data, size);
    return;
  }
  line.push_back('"');
  for (std::size_t i = 0; i < size; ++i) {
    if (data[i] == '"') line.push_back('"');
    line.push_back(data[i]);
  }
  line.push_back('"');
}

}  // namespace isortcli
