// SPDX-License-Identifier: Apache-2.0
// Command 4: factory calibration items of one sensor from the sensors registry.
#pragma once

#include <stdint.h>

int read_calib_data(const uint8_t* frame);
