// SPDX-License-Identifier: Apache-2.0
// The shared store of the latest factory test results and the magnetometer sensitivities.
// Written by the service callback, read by the command handlers after wait_for_response.
#pragma once

#include <stdint.h>

#include "factory_results.h"

// A copy of the whole store. Read by the handlers after the command_waiter hand-over; a late
// indication may still overwrite the store meanwhile, so the copy is taken under the store's
// own lock and the handler builds its reply from one consistent set of words.
factory_results factory_state();

void set_test_status(int32_t status);
int32_t test_status();

// Overwrite a result field as a whole (words in indication order).
void store_accel_result(const int32_t (&words)[8]);
void store_gyro_result(const int32_t (&words)[12]);
void store_mag_result(const int32_t (&words)[16]);
void store_pressure_result(const int32_t (&words)[2]);

mag_sensitivity_values mag_sensitivity();
void set_mag_sensitivity(float x, float y, float z);

// Every field back to zero, as at process start.
void reset_factory_state_for_testing();
