// The runtime's wide-character assertion facility: report and return.
#include <cstdint>
#include <string>

#include "hostinternal.h"
#include "isort/host/rtassert.h"

namespace {

// UTF-8 of a wide string (UTF-16 where wchar_t has 16 bits, else UTF-32).
std::string Narrow(const wchar_t* text) {
  std::string out;
  if (!text) return out;
  for (const wchar_t* p = text; *p; ++p) {
    std::uint32_t c = static_cast<std::uint32_t>(*p);
    if (sizeof(wchar_t) == 2 && c >= 0xD800 && c < 0xDC00 && p[1] >= 0xDC00 && p[1] < 0xE000) {
      c = 0x10000 + ((c - 0xD800) << 10) + (static_cast<std::uint32_t>(p[1]) - 0xDC00);
      ++p;
    }
    if (c > 0x10FFFF || (c >= 0xD800 && c < 0xE000)) c = 0xFFFD;
    if (c < 0x80) {
      out += static_cast<char>(c);
    } else if (c < 0x800) {
      out += static_cast<char>(0xC0 | (c >> 6));
      out += static_cast<char>(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
      out += static_cast<char>(0xE0 | (c >> 12));
      out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (c & 0x3F));
    } else {
      out += static_cast<char>(0xF0 | (c >> 18));
      out += static_cast<char>(0x80 | ((c >> 12) & 0x3F));
      out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
      out += static_cast<char>(0x80 | (c & 0x3F));
    }
  }
  return out;
}

}  // namespace

extern "C" void VexaRuntimeAssert(const wchar_t* expression, const wchar_t* file, unsigned line) {
  try {
    vexahost::internal::Report("Assertion failed: " + Narrow(expression) + ", file " +
                               Narrow(file) + ", line " + std::to_string(line));
  } catch (...) {
    // Out of memory while building the text: nothing better to report with.
  }
}
