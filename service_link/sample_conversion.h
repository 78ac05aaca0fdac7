// SPDX-License-Identifier: Apache-2.0
// Conversion of a sensor-manager sample indication into the kernel's sample_frame.
#pragma once

#include <stdint.h>

#include "factory_results.h"
#include "kernel_frame.h"

// Fills frame (unset values zero) from the sensor id, data-type byte and the three raw words.
void convert_sample(uint8_t sensor_id, uint8_t data_type, int32_t x, int32_t y, int32_t z,
                    const mag_sensitivity_values& sensitivity, sample_frame* frame);

// T(v): truncation toward zero to 32 bits, saturating, NaN to 0, then the low 16 bits.
int16_t to_frame_value(double v);
