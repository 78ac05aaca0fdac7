// Placeholder until the status requests land.
#include "status_requests.h"

int get_sensor_state() { return 0; }
int get_status(const uint8_t*) { return 0; }
int reset_mag_cal() { return 0; }
