// The kernel's sensor_type against the sensor manager's ids, the reply codes, and the sensor
// UIDs of the drivers reached through the driver access service.
#pragma once

#include <stdint.h>

// Sensor-manager id of a sensor_type; out_of_range for anything outside 0..15 (tested as an
// unsigned number, so negative values are out of range) and -1 for the types without one.
int32_t smgr_id_by_sensor_type(int32_t sensor_type, int32_t out_of_range = -1);

// Kernel reply code of a sensor-manager id: 0, 1, 2, 3, 5, 6 or -1.
int32_t pdata_sensor_type(int32_t smgr_id);

extern const uint8_t light_sensor_suid[16];
extern const uint8_t accel_suid[16];
extern const uint8_t mag_suid[16];
extern const uint8_t pressure_suid[16];

// Copies the SUID of sensor_type into suid and returns true; logs and writes nothing otherwise.
bool getUUID(uint32_t sensor_type, uint8_t* suid);
