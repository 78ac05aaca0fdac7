// SPDX-License-Identifier: Apache-2.0
// The kernel's sensor_type against the sensor manager's ids, the reply codes, and the sensor
// UIDs of the drivers reached through the driver access service.
#pragma once

#include <stdint.h>

// smgr_id_by_sensor_type and pdata_sensor_type, shared with the tools.
#include "kernel_sensors.h"

extern const uint8_t light_sensor_suid[16];
extern const uint8_t accel_suid[16];
extern const uint8_t mag_suid[16];
extern const uint8_t pressure_suid[16];

// Copies the SUID of sensor_type into suid and returns true; logs and writes nothing otherwise.
bool getUUID(uint32_t sensor_type, uint8_t* suid);
