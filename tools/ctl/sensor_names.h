// SPDX-License-Identifier: Apache-2.0
// Sensors and numbers on kestrelctl's command line, and the names of sensor_types and sensor codes
// (kernel_sensors.h) in what it prints.
#pragma once

#include <stdint.h>

#include <string>

namespace kestrelctl {

// A signed 32-bit number: decimal with an optional sign, or 0x hex. Hex takes the whole 32-bit
// range, so 0xffffffff is -1. False for anything else, out-of-range values included.
bool parse_int32(const std::string& text, int32_t* value);

// A sensor by name (accel, gyro, mag, pressure, light, light-short, or the long names
// accelerometer, gyroscope, magnetometer) or by sensor_type number (parse_int32).
bool parse_sensor(const std::string& text, int32_t* sensor_type);

// What a sensor_type stands for: "accel" ... "light-short" for 0 to 5, else the sensor of its
// sensor-manager id ("mag" for 8), "sensor 60", or "no sensor".
std::string sensor_type_name(int32_t sensor_type);

// What a kernel sensor code stands for: 0 accel, 1 gyro, 2 mag, 3 pressure, 5 light,
// 6 sensor 60, -1 no sensor; 4 is the raw (secondary or light-colour) data of samples.
std::string sensor_code_name(int32_t code);

}  // namespace kestrelctl
