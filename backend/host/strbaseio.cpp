// The stream base: failure and end-of-file states, and an empty window.
#include "isort/host/iostore.h"

VEXA_StrBaseIO::VEXA_StrBaseIO()
    : cursor_(nullptr), readEnd_(nullptr), writeEnd_(nullptr), failed_(false), atEnd_(false) {}

// A copy starts with no window and clean states; the derived class sets up
// its own buffer.
VEXA_StrBaseIO::VEXA_StrBaseIO(const VEXA_StrBaseIO&) : VEXA_StrBaseIO() {}

VEXA_StrBaseIO::~VEXA_StrBaseIO() {}

void VEXA_StrBaseIO::Clear() {
  failed_ = false;
  atEnd_ = false;
}

int VEXA_StrBaseIO::Good() { return failed_ ? 0 : 1; }

int VEXA_StrBaseIO::EndOfFile() { return atEnd_ ? 1 : 0; }
