// VEXAWLIB: clocks, processor counts, value moves and internal checks.
#pragma once

#include <cstdint>

#include "vexatypes.h"

extern "C" {

// Two clock readings in milliseconds, wrapping at 32 bits: `first` the
// process's CPU time, `second` the wall-clock time.
VEXAHOST_API void VEXA_STDCALL TIMTOT(FortranInt* first, FortranInt* second);

// The host's thread setting (the most threads a problem should use).
VEXAHOST_API unsigned int GETTHREADS();
// Processor packages in the machine, and cores in each.
VEXAHOST_API unsigned int getPhysicalCPUCount();
VEXAHOST_API unsigned int getCoresPerPhysicalCPUCount();

// Copies *n values from `from` to `to` (non-overlapping), as memcpy would.
VEXAHOST_API void VEXA_STDCALL OBMOVE(const OBS* from, OBS* to, const FortranInt* n);

// High 32-bit words of the doubles (code - 100) for the compressed case
// encoding's codes 1 to 251 (the low words are 0); other entries are 0.
VEXAHOST_API extern const std::uint32_t IEEEPart1[256];

// Reports a failed internal condition of a Fortran-callable routine and
// returns: the routine's name and the condition's text, each with its length
// by address and by value.
VEXAHOST_API void VEXA_STDCALL ASSERT(const FortranInt* nameLength, const char* name,
                                      FortranInt nameLengthValue, const FortranInt* textLength,
                                      const char* text, FortranInt textLengthValue);
}
