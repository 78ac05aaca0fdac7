// SPDX-License-Identifier: Apache-2.0
// Magnetometer fuse ROM and registers, accelerometer low-pass filter, motor state, register
// dumps.
#pragma once

#include <stdint.h>

int get_mag_register_data(int32_t read_id, int32_t reply);
int set_accel_lpf(int32_t code);
int set_accel_motor(int32_t code);
int dump_register(uint32_t sensor_type);
