// SPDX-License-Identifier: Apache-2.0
// Factory self tests and the gyroscope replies.
#pragma once

#include <stdint.h>

int get_selftest_result(uint32_t test_type);
void send_gyro_selftest_result();
