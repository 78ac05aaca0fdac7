// SPDX-License-Identifier: Apache-2.0
// The three small status requests of the sensor manager.
#pragma once

#include <stdint.h>

int get_sensor_state();
int get_status(const uint8_t* frame);  // command 0
int reset_mag_cal();
