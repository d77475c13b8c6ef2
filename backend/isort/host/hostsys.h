// hostsys: collation of string keys.
#pragma once

#include "vexatypes.h"

// Three-way collation of two byte strings of given lengths. Construct, call
// Init() once, then Compare() any number of times; Compare() is const and
// allocates nothing. A copy compares exactly as its original and needs no
// Init(). Each object is used by one thread at a time.
class VEXAHOST_API VEXAMBCollator {
 public:
  VEXAMBCollator();
  VEXAMBCollator(const VEXAMBCollator& other);
  VEXAMBCollator& operator=(const VEXAMBCollator&) = delete;
  ~VEXAMBCollator();

  // Chooses the collation from the host's setting (byte order by default).
  void Init();

  // Negative when a sorts first, positive when b does, 0 when they collate
  // equal. Only the sign is meaningful; the magnitude may be any value.
  int Compare(const char* a, unsigned int lengthA, const char* b, unsigned int lengthB) const;

 private:
  // 256 weights, one per byte value, or null for plain unsigned byte order.
  const unsigned char* weights_;
};
