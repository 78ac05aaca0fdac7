// SPDX-License-Identifier: Apache-2.0
// libdiag: the calls the daemon makes to set the DIAG buffering mode of the sensor processor.
#pragma once

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

bool Diag_LSM_Init(uint8_t* unused);
bool Diag_LSM_DeInit(void);
int diag_configure_peripheral_buffering_tx_mode(uint8_t peripheral, uint8_t tx_mode,
                                                uint8_t low_wm, uint8_t high_wm);

#ifdef __cplusplus
}
#endif
