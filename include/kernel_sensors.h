// SPDX-License-Identifier: Apache-2.0
// The sensors as the kernel factory driver knows them. Commands name a sensor by its sensor_type,
// the kernel's index (0 to 15 on the phone, any signed 32-bit value on the wire), which the
// daemon maps to a sensor-manager id; replies and samples name it by the kernel's sensor code,
// which the daemon derives from the sensor-manager id.
#pragma once

#include <stdint.h>

#include "sensor1_messages.h"

// The sensor_types that name one sensor of their own.
enum kernel_sensor_type : int32_t {
  SENSOR_TYPE_ACCEL = 0,
  SENSOR_TYPE_GYRO = 1,
  SENSOR_TYPE_MAG = 2,
  SENSOR_TYPE_PRESSURE = 3,
  SENSOR_TYPE_LIGHT = 4,
  SENSOR_TYPE_LIGHT_SHORT = 5,
};

// The registers of sensor_types 0 to this one can be dumped.
constexpr int32_t kLastDumpSensorType = SENSOR_TYPE_LIGHT_SHORT;

// The kernel's sensor codes.
enum kernel_sensor_code : int32_t {
  SENSOR_CODE_NONE = -1,
  SENSOR_CODE_ACCEL = 0,
  SENSOR_CODE_GYRO = 1,
  SENSOR_CODE_MAG = 2,
  SENSOR_CODE_PRESSURE = 3,
  SENSOR_CODE_RAW = 4,  // samples of secondary values, and the light sensor's colour data
  SENSOR_CODE_LIGHT = 5,
  SENSOR_CODE_ID60 = 6,
};

// The sensor-manager id of each sensor_type, -1 for the types without one.
constexpr int32_t kSmgrIdBySensorType[16] = {
    kSmgrAccel, kSmgrGyro, kSmgrMag, kSmgrPressure, kSmgrLight, kSmgrLight, kSmgrId60,  -1,
    kSmgrMag,   kSmgrMag,  -1,       kSmgrGyro,     kSmgrAccel, kSmgrAccel, kSmgrAccel, kSmgrAccel};

// Every sensor-manager id with the kernel's code for it and a name for people.
struct kernel_sensor {
  int32_t smgr_id;
  kernel_sensor_code code;
  const char* name;
};
constexpr kernel_sensor kKernelSensors[] = {
    {kSmgrAccel, SENSOR_CODE_ACCEL, "accel"}, {kSmgrGyro, SENSOR_CODE_GYRO, "gyro"},
    {kSmgrMag, SENSOR_CODE_MAG, "mag"},       {kSmgrPressure, SENSOR_CODE_PRESSURE, "pressure"},
    {kSmgrLight, SENSOR_CODE_LIGHT, "light"}, {kSmgrId60, SENSOR_CODE_ID60, "sensor 60"},
};

// Sensor-manager id of a sensor_type; out_of_range for anything outside 0..15 (tested as an
// unsigned number, so negative values are out of range) and -1 for the types without one.
constexpr int32_t smgr_id_by_sensor_type(int32_t sensor_type, int32_t out_of_range = -1) {
  return static_cast<uint32_t>(sensor_type) > 15 ? out_of_range : kSmgrIdBySensorType[sensor_type];
}

// The sensor of a sensor-manager id, null for none.
constexpr const kernel_sensor* kernel_sensor_of(int32_t smgr_id) {
  for (const kernel_sensor& s : kKernelSensors) {
    if (s.smgr_id == smgr_id) return &s;
  }
  return nullptr;
}

// Kernel reply code of a sensor-manager id: 0, 1, 2, 3, 5, 6 or -1.
constexpr int32_t pdata_sensor_type(int32_t smgr_id) {
  return kernel_sensor_of(smgr_id) != nullptr ? kernel_sensor_of(smgr_id)->code : SENSOR_CODE_NONE;
}
static_assert(pdata_sensor_type(kSmgrLight) == 5 && pdata_sensor_type(-1) == -1 &&
                  smgr_id_by_sensor_type(-1) == -1 && smgr_id_by_sensor_type(8) == kSmgrMag,
              "");
