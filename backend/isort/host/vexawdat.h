// VEXAWDAT: the host's reporting function for errors.
#pragma once

#include "vexatypes.h"

// Reports an error text with its attribute to the host's message sink.
VEXAHOST_API void Reporter(const char* text, int attribute);
