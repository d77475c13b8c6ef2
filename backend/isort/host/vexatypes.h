// Types and calling conventions shared by the host libraries and the sort.
#pragma once

#include <cstdint>

// One 8-byte value of a case: an IEEE double, or eight bytes of string text.
// Values are moved as bit patterns (memcpy), never through a floating-point
// register, so string bytes that look like a signaling NaN survive.
typedef double OBS;

// A Fortran INTEGER: 32 bits on every platform. The host's interfaces call it
// `long`, which is 64 bits on LP64 Linux, so every Fortran-facing signature
// and the packed-record header use this type instead.
typedef std::int32_t FortranInt;

// The calling convention of the Fortran-callable entries and host routines.
#if defined(_WIN32) && !defined(_WIN64)
#define VEXA_STDCALL __stdcall
#else
#define VEXA_STDCALL
#endif

// Export/import of the stand-in host library (libvexahost / vexahost.dll).
#if defined(_WIN32)
#if defined(VEXAHOST_BUILD)
#define VEXAHOST_API __declspec(dllexport)
#else
#define VEXAHOST_API __declspec(dllimport)
#endif
#else
#define VEXAHOST_API __attribute__((visibility("default")))
#endif
