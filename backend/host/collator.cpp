// VEXAMBCollator: byte order, or a weight per byte value.
#include <cstdint>
#include <cstring>

#include "hostinternal.h"
#include "isort/host/hostsys.h"

namespace {

struct FoldTable {
  unsigned char weight[256];
};

constexpr FoldTable MakeFold() {
  FoldTable t{};
  for (int c = 0; c < 256; ++c)
    t.weight[c] = static_cast<unsigned char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
  return t;
}

// ASCII letters without case; every other byte by its value.
constexpr FoldTable kCaseFold = MakeFold();

inline std::uint64_t Load64(const char* p) {
  std::uint64_t v;
  std::memcpy(&v, p, sizeof v);
  return v;
}

inline int LengthOrder(unsigned int lengthA, unsigned int lengthB) {
  return lengthA < lengthB ? -1 : lengthA > lengthB ? 1 : 0;
}

}  // namespace

VEXAMBCollator::VEXAMBCollator() : weights_(nullptr) {}

VEXAMBCollator::VEXAMBCollator(const VEXAMBCollator& other) : weights_(other.weights_) {}

VEXAMBCollator::~VEXAMBCollator() {}

void VEXAMBCollator::Init() {
  weights_ = vexahost::internal::CaseInsensitiveCollation() ? kCaseFold.weight : nullptr;
}

int VEXAMBCollator::Compare(const char* a, unsigned int lengthA, const char* b,
                            unsigned int lengthB) const {
  const unsigned int common = lengthA < lengthB ? lengthA : lengthB;
  const unsigned char* ua = reinterpret_cast<const unsigned char*>(a);
  const unsigned char* ub = reinterpret_cast<const unsigned char*>(b);
  unsigned int i = 0;
  if (!weights_) {
    // Eight bytes at a time; the first differing byte is the lowest set
    // byte of the XOR on a little-endian load.
    for (; i + 8 <= common; i += 8) {
      const std::uint64_t x = Load64(a + i) ^ Load64(b + i);
      if (x) {
        const unsigned int j = i + static_cast<unsigned int>(__builtin_ctzll(x)) / 8;
        return static_cast<int>(ua[j]) - static_cast<int>(ub[j]);
      }
    }
    for (; i < common; ++i)
      if (ua[i] != ub[i]) return static_cast<int>(ua[i]) - static_cast<int>(ub[i]);
    return LengthOrder(lengthA, lengthB);
  }
  for (; i < common; ++i) {
    const int wa = weights_[ua[i]];
    const int wb = weights_[ub[i]];
    if (wa != wb) return wa - wb;
  }
  return LengthOrder(lengthA, lengthB);
}
