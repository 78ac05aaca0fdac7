// SPDX-License-Identifier: Apache-2.0
// Command 6: run and store the calibration of one sensor.
#pragma once

#include <stdint.h>

int store_calib_data(const uint8_t* frame);
