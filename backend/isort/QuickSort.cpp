// The in-memory sort of a batch with the sort's comparison.
#include "QuickSort.h"

#include "FileSortInternal.h"

namespace {

struct EntryOrder {
  const FileSort::KeyCompare& compare;
  int operator()(const OBS* a, const OBS* b) const { return compare.Compare(a, b); }
};

}  // namespace

void SwapEntries(OBS* x, OBS* y, unsigned int width) { quicksort::Swap(x, y, width); }

OBS* MedianOfThree(OBS* a, OBS* b, OBS* c, const FileSort::KeyCompare& compare) {
  return quicksort::Median(a, b, c, EntryOrder{compare});
}

void QuickSortEntries(OBS* entries, unsigned int count, unsigned int width,
                      const FileSort::KeyCompare& compare) {
  quicksort::Sort(entries, count, width, EntryOrder{compare});
}
