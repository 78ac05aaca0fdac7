// Placeholder until the registry stand-in lands.
#include "sensor_reg.h"

extern "C" {
int sensor_reg_open(void) { return -1; }
int sensor_reg_read(uint16_t, uint32_t, uint8_t**, uint8_t* len) {
  *len = 0;
  return -1;
}
int sensor_reg_close(void) { return 0; }
}
