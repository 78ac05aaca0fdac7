// Placeholder until the libdiag stand-in lands.
#include "diag_lsm.h"

extern "C" {
bool Diag_LSM_Init(uint8_t*) { return false; }
bool Diag_LSM_DeInit(void) { return true; }
int diag_configure_peripheral_buffering_tx_mode(uint8_t, uint8_t, uint8_t, uint8_t) { return 0; }
}
