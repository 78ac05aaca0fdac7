// SPDX-License-Identifier: Apache-2.0
// libdiag of the host build. Nothing is configured for real: Diag_LSM_Init succeeds unless
// KESTREL_DIAG_INIT is "fail", and the buffering-mode call returns KESTREL_DIAG_TX_MODE_RESULT.
// Every call logs one info line under the tag "libdiag", so a test sees the order of these calls
// among the daemon's own lines.
#include "diag_lsm.h"

#include <android/log.h>

#include "host_env.h"

namespace {

constexpr char kTag[] = "libdiag";

}  // namespace

extern "C" {

bool Diag_LSM_Init(uint8_t*) {
  const bool ok = host_environment().diag_init_ok;
  __android_log_print(ANDROID_LOG_INFO, kTag, "Diag_LSM_Init %s", ok ? "ok" : "fail");
  return ok;
}

bool Diag_LSM_DeInit(void) {
  __android_log_print(ANDROID_LOG_INFO, kTag, "Diag_LSM_DeInit");
  return true;
}

int diag_configure_peripheral_buffering_tx_mode(uint8_t peripheral, uint8_t tx_mode, uint8_t low_wm,
                                                uint8_t high_wm) {
  const int result = host_environment().diag_tx_mode_result;
  __android_log_print(
      ANDROID_LOG_INFO, kTag, "diag_configure_peripheral_buffering_tx_mode %u %u %u %u -> %d",
      unsigned{peripheral}, unsigned{tx_mode}, unsigned{low_wm}, unsigned{high_wm}, result);
  return result;
}

}  // extern "C"
