// VEXAWCOM: the host's common blocks, as static blocks of this library.
//
// Only the global block has contents the host defines here: the
// system-missing value, -DBL_MAX, at byte 8. The blocks are constant-
// initialised, so they hold their values before any code runs.
#include <cfloat>
#include <cstddef>

#include "host/hostsettings.h"
#include "isort/host/vexawcom.h"

namespace {

constexpr std::size_t kBlockBytes = 4096;

struct alignas(16) Block {
  unsigned char bytes[kBlockBytes];
};

struct alignas(16) GlobalBlock {
  double first;
  double systemMissing;
  unsigned char rest[kBlockBytes - 2 * sizeof(double)];
};
static_assert(offsetof(GlobalBlock, systemMissing) == kSystemMissingOffset,
              "the system-missing value sits at byte 8 of the global block");

GlobalBlock g_glb = {0.0, -DBL_MAX, {}};
Block g_bpr, g_aDic, g_aGlb, g_aMch, g_aObv, g_aSym, g_aSys, g_dic, g_dmo, g_inc, g_io, g_loc,
    g_mch, g_mcs, g_obv, g_stk, g_sym, g_sys, g_wrk, g_dtm, g_box;

}  // namespace

extern "C" {
void* pvGetCmnBpr() { return &g_bpr; }
void* pvGetCmaDic() { return &g_aDic; }
void* pvGetCmaGlb() { return &g_aGlb; }
void* pvGetCmaMch() { return &g_aMch; }
void* pvGetCmaObv() { return &g_aObv; }
void* pvGetCmaSym() { return &g_aSym; }
void* pvGetCmaSys() { return &g_aSys; }
void* pvGetCmnDic() { return &g_dic; }
void* pvGetCmnDmo() { return &g_dmo; }
void* pvGetCmnGlb() { return &g_glb; }
void* pvGetCmnInc() { return &g_inc; }
void* pvGetCmnIo() { return &g_io; }
void* pvGetCmnLoc() { return &g_loc; }
void* pvGetCmnMch() { return &g_mch; }
void* pvGetCmnMcs() { return &g_mcs; }
void* pvGetCmnObv() { return &g_obv; }
void* pvGetCmnStk() { return &g_stk; }
void* pvGetCmnSym() { return &g_sym; }
void* pvGetCmnSys() { return &g_sys; }
void* pvGetCmnWrk() { return &g_wrk; }
void* pvGetCmnDtm() { return &g_dtm; }
void* pvGetCmnBox() { return &g_box; }
}

namespace vexahost {
const OBS* SystemMissing() { return &g_glb.systemMissing; }
}  // namespace vexahost
