// SPDX-License-Identifier: Apache-2.0
// Start and stop of raw-data streams (commands 1 and 3).
#pragma once

#include <stdint.h>

int get_raw_data(const uint8_t* frame);
int stop_raw_data(const uint8_t* frame);

void reset_raw_data_flags_for_testing();
