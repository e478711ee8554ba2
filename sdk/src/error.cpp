#include "zepasdk/kv.h"

namespace {
thread_local int g_lastError = ZEPA_ERR_NONE;
}

extern "C" {

int VLIBCErrGet(void) { return g_lastError; }

void VLIBCErrSet(int code) { g_lastError = code; }

}  // extern "C"
