// The C runtime's wide-character assertion facility, as the host's runtime
// provides it: reports "Assertion failed: <expression>, file <file>, line
// <line>" to the host's message sink and returns, so the caller goes on.
#pragma once

#include "vexatypes.h"

extern "C" VEXAHOST_API void VexaRuntimeAssert(const wchar_t* expression, const wchar_t* file,
                                               unsigned line);
