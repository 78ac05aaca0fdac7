// SPDX-License-Identifier: Apache-2.0
// The latest results of factory tests, handed from the service callback to the command
// handlers, and the magnetometer sensitivities the sample conversion divides by.
#pragma once

#include <stdint.h>

struct factory_results {
  int32_t accel_result[8];
  int32_t gyro_result[12];
  int32_t mag_result[16];
  int32_t pressure_result[2];
  int32_t test_status;
};
static_assert(sizeof(factory_results) == 4 * (8 + 12 + 16 + 2 + 1), "");

struct mag_sensitivity_values {
  float x;
  float y;
  float z;
};
