// The host's common-block addresses, which the library takes once when it is
// attached to a process (attach.cpp), before any entry point runs; read-only
// afterwards, so any thread may use them.
#pragma once

#include "isort/host/vexatypes.h"

// The blocks, in the order the host is asked for them.
enum CommonBlock {
  kCmnBpr,
  kCmaDic,
  kCmaGlb,
  kCmaMch,
  kCmaObv,
  kCmaSym,
  kCmaSys,
  kCmnDic,
  kCmnDmo,
  kCmnGlb,
  kCmnInc,
  kCmnIo,
  kCmnLoc,
  kCmnMch,
  kCmnMcs,
  kCmnObv,
  kCmnStk,
  kCmnSym,
  kCmnSys,
  kCmnWrk,
  kCmnDtm,
  kCmnBox,
  kCommonBlockCount
};

// The address the host gave for `block`; null before the library was attached.
void* CommonBlockAddress(CommonBlock block);

// The system-missing value: the 8 bytes at offset 8 of the global block.
// Read it with memcpy (it is a bit pattern, never to pass through a
// floating-point register).
const unsigned char* SystemMissingPattern();
