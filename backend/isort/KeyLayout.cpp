// Splitting records into key part and rest part, and the comparison context.
#include <algorithm>

#include "FileSortInternal.h"

FileSort::KeyLayout::KeyLayout(const std::vector<SortKey>& keys, std::uint32_t nvars) {
  keySegments.reserve(keys.size());
  std::vector<bool> covered(nvars, false);
  for (const SortKey& key : keys) {
    const std::uint32_t first = static_cast<std::uint32_t>(key.variable);
    const std::uint32_t step = KeyStep(key.width);
    keySegments.push_back({first, step});
    keyValues += step;
    std::fill(covered.begin() + first, covered.begin() + first + step, true);
  }
  for (std::uint32_t i = 0; i < nvars;) {
    if (covered[i]) {
      ++i;
      continue;
    }
    std::uint32_t last = i;
    while (last + 1 < nvars && !covered[last + 1]) ++last;
    restSegments.push_back({i, last - i + 1});
    restValues += last - i + 1;
    i = last + 1;
  }
}

void FileSort::KeyLayout::Split(const OBS* record, OBS* keyPart, OBS* restPart) const {
  for (const Segment& s : keySegments) {
    std::memcpy(keyPart, record + s.first, s.count * sizeof(OBS));
    keyPart += s.count;
  }
  for (const Segment& s : restSegments) {
    std::memcpy(restPart, record + s.first, s.count * sizeof(OBS));
    restPart += s.count;
  }
}

void FileSort::KeyLayout::Join(const OBS* keyPart, const OBS* restPart, OBS* record) const {
  for (const Segment& s : keySegments) {
    std::memcpy(record + s.first, keyPart, s.count * sizeof(OBS));
    keyPart += s.count;
  }
  for (const Segment& s : restSegments) {
    std::memcpy(record + s.first, restPart, s.count * sizeof(OBS));
    restPart += s.count;
  }
}

FileSort::KeyCompare::KeyCompare(const std::vector<SortKey>& k) : collator(), keys(k) {
  collator.Init();
}

FileSort::KeyCompare::KeyCompare(const KeyCompare& other)
    : collator(other.collator), keys(other.keys) {}
