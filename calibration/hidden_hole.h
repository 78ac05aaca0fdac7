// Command 35 (the light sensor's hidden-hole coefficients) and the bulk-data commands.
#pragma once

#include <stdint.h>

int set_hidden_hole_data(const uint8_t* frame);
int send_bigdata(const uint8_t* frame);

// daf_request_id of a bulk-data command (0 for numbers outside the family), and its txn_id.
uint32_t bigdata_request_id(uint32_t command);
uint8_t bigdata_txn_id(uint32_t request_id);
