// Internal to the stand-in host: settings as the host's own code reads them,
// and the report sink. Never installed, never included by users.
#pragma once

#include <cstdint>
#include <cstring>
#include <string>

#include "host/hostsettings.h"

namespace vexahost {
namespace internal {

// The thread setting; never 0.
unsigned int ThreadSetting();
// The processor counts set by SetProcessorCounts; 0 when not set.
void ProcessorCountSetting(unsigned int* packages, unsigned int* coresPerPackage);
bool CaseInsensitiveCollation();
// Hands one report to the sink. Never throws.
void Report(const std::string& message) noexcept;

// The system-missing value as a bit pattern.
inline std::uint64_t SystemMissingBits() {
  std::uint64_t bits;
  std::memcpy(&bits, SystemMissing(), sizeof bits);
  return bits;
}

}  // namespace internal
}  // namespace vexahost
