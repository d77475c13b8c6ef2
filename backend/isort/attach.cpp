// Binding to the host's common blocks when the library is attached to a
// process. Nothing else runs at load time.
#include <cstring>

#include "commonblocks.h"
#include "isort/host/vexawcom.h"

#if defined(_WIN32)
#define WIN32_LEAN_AND_MEAN
#include <windows.h>
#endif

namespace {

// Written once at attach time, before any entry point can run; read-only after.
void* blocks[kCommonBlockCount];

void BindCommonBlocks() {
  // The host's order of asking; only the global block is used.
  static void* (*const getters[kCommonBlockCount])() = {
      pvGetCmnBpr, pvGetCmaDic, pvGetCmaGlb, pvGetCmaMch, pvGetCmaObv, pvGetCmaSym,
      pvGetCmaSys, pvGetCmnDic, pvGetCmnDmo, pvGetCmnGlb, pvGetCmnInc, pvGetCmnIo,
      pvGetCmnLoc, pvGetCmnMch, pvGetCmnMcs, pvGetCmnObv, pvGetCmnStk, pvGetCmnSym,
      pvGetCmnSys, pvGetCmnWrk, pvGetCmnDtm, pvGetCmnBox};
  for (int i = 0; i < kCommonBlockCount; ++i) blocks[i] = getters[i]();
}

#if defined(_WIN32)
HMODULE module;  // this library's handle, kept for the life of the process
#else
__attribute__((constructor)) void AttachLibrary() { BindCommonBlocks(); }
#endif

}  // namespace

#if defined(_WIN32)
extern "C" BOOL WINAPI DllMain(HINSTANCE instance, DWORD reason, LPVOID) {
  if (reason == DLL_PROCESS_ATTACH) {
    module = instance;
    BindCommonBlocks();
  }
  return TRUE;
}
#endif

void* CommonBlockAddress(CommonBlock block) {
  return block >= 0 && block < kCommonBlockCount ? blocks[block] : nullptr;
}

const unsigned char* SystemMissingPattern() {
  // Should the library be linked in a way that skipped the attach hook, the
  // host still knows where its global block is.
  void* global = blocks[kCmnGlb] ? blocks[kCmnGlb] : pvGetCmnGlb();
  return static_cast<const unsigned char*>(global) + kSystemMissingOffset;
}
