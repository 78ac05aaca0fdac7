// Placeholder until hidden-hole and bulk data land.
#include "hidden_hole.h"

int set_hidden_hole_data(const uint8_t*) { return 0; }
int send_bigdata(const uint8_t*) { return 0; }
uint32_t bigdata_request_id(uint32_t) { return 0; }
uint8_t bigdata_txn_id(uint32_t) { return 123; }
