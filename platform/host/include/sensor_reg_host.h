// SPDX-License-Identifier: Apache-2.0
// Host-only addition of the sensors-registry stand-in, for tests and fuzzing. The daemon never
// includes this file.
#pragma once

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

// Parses registry text exactly as sensor_reg_open parses the KESTREL_SENSOR_REG file, without
// touching the registry's state. Returns the number of lines taken.
int sensor_reg_host_parse(const char* text, size_t length);

#ifdef __cplusplus
}
#endif
