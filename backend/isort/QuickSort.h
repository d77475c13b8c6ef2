// The in-memory sort of a batch, on fixed-width entries, in place: a
// quicksort with insertion sort below 7 entries, the middle entry as pivot at
// 7, a median of three up to 40 and a median of three medians above.
//
// Written once as templates over the three-way comparison `cmp(a, b)` (sign
// only), so tests can drive the very same code with an instrumented
// comparison; the sort itself uses it with FileSort::KeyCompare.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "isort/host/vexatypes.h"

namespace quicksort {

inline void Swap(OBS* x, OBS* y, unsigned int width) {
  // Whole 8-byte patterns, never through a floating-point register.
  for (unsigned int i = 0; i < width; ++i) {
    std::uint64_t a, b;
    std::memcpy(&a, x + i, 8);
    std::memcpy(&b, y + i, 8);
    std::memcpy(x + i, &b, 8);
    std::memcpy(y + i, &a, 8);
  }
}

template <class Cmp>
OBS* Median(OBS* a, OBS* b, OBS* c, const Cmp& cmp) {
  if (cmp(a, b) < 0) {
    if (cmp(b, c) < 0) return b;
    return cmp(a, c) < 0 ? c : a;
  }
  if (cmp(b, c) > 0) return b;
  return cmp(a, c) > 0 ? c : a;
}

// Moves the chosen pivot to the front and partitions around it; returns the
// pivot's final index. REQUIRES: n >= 7.
template <class Cmp>
std::size_t Partition(OBS* base, std::size_t n, unsigned int width, const Cmp& cmp) {
  auto at = [base, width](std::size_t i) { return base + i * width; };
  OBS* mid = at(n / 2);
  OBS* pivot = mid;
  if (n > 40) {
    const std::size_t d = n / 8;
    OBS* lo = Median(at(0), at(d), at(2 * d), cmp);
    OBS* m = Median(at(n / 2 - d), mid, at(n / 2 + d), cmp);
    OBS* hi = Median(at(n - 1 - 2 * d), at(n - 1 - d), at(n - 1), cmp);
    pivot = Median(lo, m, hi, cmp);
  } else if (n > 7) {
    pivot = Median(at(0), mid, at(n - 1), cmp);
  }
  Swap(pivot, base, width);

  std::size_t i = 0, j = n;
  for (;;) {
    do {
      ++i;
    } while (i < n && cmp(at(i), base) < 0);
    // Stops at the pivot at the latest, which compares equal to itself.
    do {
      --j;
    } while (cmp(at(j), base) > 0);
    if (j < i) break;
    Swap(at(i), at(j), width);
  }
  Swap(at(j), base, width);
  return j;
}

template <class Cmp>
void InsertionSort(OBS* base, std::size_t n, unsigned int width, const Cmp& cmp) {
  for (std::size_t p = 1; p < n; ++p) {
    for (std::size_t q = p; q > 0; --q) {
      OBS* cur = base + q * width;
      OBS* prev = cur - width;
      if (cmp(prev, cur) <= 0) break;
      Swap(prev, cur, width);
    }
  }
}

template <class Cmp>
void Sort(OBS* base, std::size_t n, unsigned int width, const Cmp& cmp) {
  while (n >= 7) {
    const std::size_t k = Partition(base, n, width, cmp);
    OBS* right = base + (k + 1) * width;
    const std::size_t rightCount = n - k - 1;
    // Recurse into the smaller side and loop on the larger: the depth stays
    // logarithmic whatever the pivots, and as the two sides are sorted
    // independently the result is the same whichever goes first.
    if (k < rightCount) {
      Sort(base, k, width, cmp);
      base = right;
      n = rightCount;
    } else {
      Sort(right, rightCount, width, cmp);
      n = k;
    }
  }
  InsertionSort(base, n, width, cmp);
}

}  // namespace quicksort
