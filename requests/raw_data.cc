// Placeholder until raw-data streaming lands.
#include "raw_data.h"

int get_raw_data(const uint8_t*) { return 0; }
int stop_raw_data(const uint8_t*) { return 0; }
void reset_raw_data_flags_for_testing() {}
