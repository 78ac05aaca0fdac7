// Placeholder until register access lands.
#include "register_access.h"

int get_mag_register_data(int32_t, int32_t) { return 0; }
int set_accel_lpf(int32_t) { return 0; }
int set_accel_motor(int32_t) { return 0; }
int dump_register(uint32_t) { return 0; }
