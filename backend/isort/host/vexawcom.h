// VEXAWCOM: addresses of the host's common blocks.
//
// The global block (pvGetCmnGlb) holds, at byte offset 8, the system-missing
// value: the 8-byte pattern that stands for a missing number.
#pragma once

#include "vexatypes.h"

extern "C" {
VEXAHOST_API void* pvGetCmnBpr();
VEXAHOST_API void* pvGetCmaDic();
VEXAHOST_API void* pvGetCmaGlb();
VEXAHOST_API void* pvGetCmaMch();
VEXAHOST_API void* pvGetCmaObv();
VEXAHOST_API void* pvGetCmaSym();
VEXAHOST_API void* pvGetCmaSys();
VEXAHOST_API void* pvGetCmnDic();
VEXAHOST_API void* pvGetCmnDmo();
VEXAHOST_API void* pvGetCmnGlb();
VEXAHOST_API void* pvGetCmnInc();
VEXAHOST_API void* pvGetCmnIo();
VEXAHOST_API void* pvGetCmnLoc();
VEXAHOST_API void* pvGetCmnMch();
VEXAHOST_API void* pvGetCmnMcs();
VEXAHOST_API void* pvGetCmnObv();
VEXAHOST_API void* pvGetCmnStk();
VEXAHOST_API void* pvGetCmnSym();
VEXAHOST_API void* pvGetCmnSys();
VEXAHOST_API void* pvGetCmnWrk();
VEXAHOST_API void* pvGetCmnDtm();
VEXAHOST_API void* pvGetCmnBox();
}

// Byte offset of the system-missing value in the global block.
constexpr unsigned kSystemMissingOffset = 8;
