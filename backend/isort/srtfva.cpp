// SRTFVA: checks a caller's sort keys and lays out the packed record for them.
#include <cstdint>
#include <cstring>
#include <new>
#include <stdexcept>
#include <vector>

#include "isort/host/vexawlib.h"
#include "sortfile.h"

namespace {

constexpr FortranInt kInvalidKeys = 10;

// Values a key spans: (width - 1) / 8 + 1, the division truncating toward
// zero, so a numeric key (width 0) spans one.
std::int64_t KeyValues(FortranInt width) { return (std::int64_t{width} - 1) / 8 + 1; }

// Reports a failed consistency condition through the host and goes on.
void Check(bool holds, const char* text) {
  if (holds) return;
  static const char kRoutine[] = "SRTFVA";
  const FortranInt nameLength = sizeof kRoutine - 1;
  const FortranInt textLength = static_cast<FortranInt>(std::strlen(text));
  ASSERT(&nameLength, kRoutine, nameLength, &textLength, text, textLength);
}

}  // namespace

FortranInt VEXA_STDCALL SRTFVA(const FortranInt* nIn, const FortranInt* ukeys, FortranInt* keysOut,
                               FortranInt* mapOut, FortranInt* nmapOut, FortranInt* nkeypairsOut,
                               FortranInt* keylengthOut, const FortranInt* widrawIn,
                               const FortranInt* packIn, const FortranInt* fillIn) {
  const std::int64_t n = *nIn;
  const std::int64_t widraw = *widrawIn;
  const bool pack = (*packIn & 1) != 0;
  const bool fill = (*fillIn & 1) != 0;
  const FortranInt* variables = ukeys;
  const FortranInt* directions = ukeys + (n > 0 ? n : 0);
  const FortranInt* widths = ukeys + 2 * (n > 0 ? n : 0);

  auto invalid = [&]() {
    *nmapOut = 0;
    *nkeypairsOut = 0;
    *keylengthOut = 0;
    return kInvalidKeys;
  };

  if (n < 0) return invalid();
  for (std::int64_t i = 0; i < n; ++i) {
    const std::int64_t v = variables[i];
    const FortranInt d = directions[i];
    const FortranInt w = widths[i];
    if (v < 1 || w < 0 || (d != 1 && d != -1) || v + KeyValues(w) > widraw + 1) return invalid();
  }

  if (!pack) {
    *nmapOut = 0;
    *nkeypairsOut = 0;
    *keylengthOut = 0;
    if (fill) {
      for (std::int64_t i = 0; i < n; ++i) {
        keysOut[3 * i] = variables[i];
        keysOut[3 * i + 1] = widths[i];
        keysOut[3 * i + 2] = directions[i];
      }
      keysOut[3 * n] = 1;
      keysOut[3 * n + 1] = -1;
      keysOut[3 * n + 2] = 1;
    }
    return 0;
  }

  // The keys in ascending order of variable, by exchange insertion: the key
  // in hand passes the placed keys, changing places with each placed key on
  // a greater variable, and takes the free place at the end. A work area of
  // our own per call: any number of keys, and no state shared between calls.
  std::vector<std::int64_t> order;
  try {
    order.resize(static_cast<std::size_t>(n));
  } catch (const std::bad_alloc&) {
    return invalid();
  } catch (const std::length_error&) {
    return invalid();
  }
  if (n > 0) order[0] = 0;
  for (std::int64_t j = 1; j < n; ++j) {
    std::int64_t inHand = j;
    for (std::int64_t p = 0; p < j; ++p) {
      if (variables[order[p]] > variables[inHand]) std::swap(order[p], inHand);
    }
    order[j] = inHand;
  }

  // Key runs: keys that touch or overlap share one run of the packed record.
  std::int64_t end = 0;  // one past the current run's last variable
  std::int64_t runs = 0;
  std::int64_t keyLength = 0;
  std::int64_t runFirst = 0;  // first variable of the current run
  std::int64_t runStart = 0;  // its packed position (the header is position 0)
  for (std::int64_t k = 0; k < n; ++k) {
    const std::int64_t key = order[k];
    const std::int64_t v = variables[key];
    const std::int64_t count = KeyValues(widths[key]);
    if (v > end) {
      runFirst = v;
      runStart = keyLength + 1;
      keyLength += count;
      end = v + count;
      if (fill) {
        mapOut[2 * runs] = static_cast<FortranInt>(v);
        mapOut[2 * runs + 1] = static_cast<FortranInt>(count);
      }
      ++runs;
    } else if (v + count > end) {
      keyLength += v + count - end;
      end = v + count;
      if (fill) mapOut[2 * (runs - 1) + 1] = static_cast<FortranInt>(end - runFirst);
    }
    if (fill) {
      keysOut[3 * key] = static_cast<FortranInt>(runStart + v - runFirst);
      keysOut[3 * key + 1] = widths[key];
      keysOut[3 * key + 2] = directions[key];
    }
  }

  const bool leadingKey = n > 0 && variables[order[0]] == 1;
  const std::int64_t nmap = 2 * runs - (leadingKey ? 1 : 0) + (end <= widraw ? 1 : 0);
  *nkeypairsOut = static_cast<FortranInt>(runs);
  *keylengthOut = static_cast<FortranInt>(keyLength);
  *nmapOut = static_cast<FortranInt>(nmap);
  if (!fill) return 0;

  // The gaps between and around the key runs, in ascending order.
  std::int64_t jmap = runs;
  std::int64_t nextIn = 1;
  std::int64_t outPos = keyLength + 1;
  for (std::int64_t r = 0; r < runs; ++r) {
    const std::int64_t first = mapOut[2 * r];
    if (first > nextIn) {
      mapOut[2 * jmap] = static_cast<FortranInt>(nextIn);
      mapOut[2 * jmap + 1] = static_cast<FortranInt>(first - nextIn);
      outPos += first - nextIn;
      ++jmap;
    }
    nextIn = first + mapOut[2 * r + 1];
  }
  if (nextIn <= widraw) {
    mapOut[2 * jmap] = static_cast<FortranInt>(nextIn);
    mapOut[2 * jmap + 1] = static_cast<FortranInt>(widraw - nextIn + 1);
    outPos += widraw - nextIn + 1;
    nextIn = widraw + 1;
    ++jmap;
  }
  Check(nextIn == widraw + 1, "NXTIN .EQ. WIDRAW+1");
  Check(outPos == widraw + 1, "OUTPOS .EQ. WIDRAW+1");
  Check(jmap == nmap, "JMAP .EQ. NMAP");

  keysOut[3 * n] = 1;
  keysOut[3 * n + 1] = -1;
  keysOut[3 * n + 2] = 1;
  return 0;
}
