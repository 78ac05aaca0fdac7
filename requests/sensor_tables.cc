// SPDX-License-Identifier: Apache-2.0
#include "sensor_tables.h"

#include <string.h>

#include "kestrel_log.h"

const uint8_t light_sensor_suid[16] = {0x33, 0xfc, 0x91, 0xdc, 0xc8, 0x0c, 0x41, 0xf2,
                                       0xa3, 0xf2, 0xce, 0xd5, 0xe2, 0x9e, 0xb7, 0x8b};
const uint8_t accel_suid[16] = {0x3c, 0xfd, 0x26, 0xe8, 0x52, 0xaf, 0x48, 0xbe,
                                0xac, 0xc2, 0x1d, 0x40, 0xfc, 0x4c, 0x53, 0x68};
const uint8_t mag_suid[16] = {0xf6, 0xae, 0x80, 0xfe, 0x94, 0x2b, 0x4d, 0x56,
                              0x8f, 0x16, 0x61, 0xd5, 0x98, 0x1b, 0x61, 0x90};
const uint8_t pressure_suid[16] = {0x40, 0x50, 0xf5, 0x06, 0x32, 0x95, 0x11, 0xe6,
                                   0x8e, 0x99, 0x40, 0xa8, 0xf0, 0x5f, 0x17, 0xff};

bool getUUID(uint32_t sensor_type, uint8_t* suid) {
  const uint8_t* source = nullptr;
  switch (sensor_type) {
    case 0:
    case 14:
    case 15:
      source = accel_suid;
      break;
    case 2:
      source = mag_suid;
      break;
    case 3:
      source = pressure_suid;
      break;
    case 4:
    case 5:
    case 6:
    case 7:
      source = light_sensor_suid;
      break;
    default:
      KLOGE("[%s] sensor_type error (%d)\n", "getUUID", static_cast<int>(sensor_type));
      return false;
  }
  memcpy(suid, source, 16);
  return true;
}
