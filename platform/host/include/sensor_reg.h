// SPDX-License-Identifier: Apache-2.0
// Sensors registry client library (libsensor_reg): factory calibration items by id.
#pragma once

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// 0 means success. A successful read hands over a malloc'ed copy of the item in *data, which
// the caller releases with free(), and its length in *len.
int sensor_reg_open(void);
int sensor_reg_read(uint16_t item_id, uint32_t arg, uint8_t** data, uint8_t* len);
int sensor_reg_close(void);

#ifdef __cplusplus
}
#endif
