// SPDX-License-Identifier: Apache-2.0
#include "sensor_names.h"

#include "kernel_sensors.h"

namespace kestrelctl {
namespace {

struct NamedSensor {
  const char* name;
  const char* long_name;
  int32_t sensor_type;
};

constexpr NamedSensor kNamedSensors[] = {
    {"accel", "accelerometer", SENSOR_TYPE_ACCEL},
    {"gyro", "gyroscope", SENSOR_TYPE_GYRO},
    {"mag", "magnetometer", SENSOR_TYPE_MAG},
    {"pressure", "pressure", SENSOR_TYPE_PRESSURE},
    {"light", "light", SENSOR_TYPE_LIGHT},
    {"light-short", "light-short", SENSOR_TYPE_LIGHT_SHORT},
};

int digit_value(char c, int base) {
  int d = -1;
  if (c >= '0' && c <= '9') d = c - '0';
  if (c >= 'a' && c <= 'f') d = c - 'a' + 10;
  if (c >= 'A' && c <= 'F') d = c - 'A' + 10;
  return d < base ? d : -1;
}

}  // namespace

bool parse_int32(const std::string& text, int32_t* value) {
  size_t i = 0;
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    i = 1;
  }
  int base = 10;
  if (text.size() > i + 2 && text[i] == '0' && (text[i + 1] == 'x' || text[i + 1] == 'X')) {
    base = 16;
    i += 2;
  }
  if (i >= text.size()) return false;
  uint64_t n = 0;
  for (; i < text.size(); ++i) {
    const int d = digit_value(text[i], base);
    if (d < 0) return false;
    n = n * static_cast<uint64_t>(base) + static_cast<uint64_t>(d);
    if (n > 0xffffffffu) return false;
  }
  if (negative) {
    if (n > 0x80000000u) return false;
    *value = static_cast<int32_t>(-static_cast<int64_t>(n));
  } else if (base == 16) {
    *value = static_cast<int32_t>(static_cast<uint32_t>(n));
  } else {
    if (n > 0x7fffffffu) return false;
    *value = static_cast<int32_t>(n);
  }
  return true;
}

bool parse_sensor(const std::string& text, int32_t* sensor_type) {
  for (const NamedSensor& s : kNamedSensors) {
    if (text == s.name || text == s.long_name) {
      *sensor_type = s.sensor_type;
      return true;
    }
  }
  return parse_int32(text, sensor_type);
}

std::string sensor_type_name(int32_t sensor_type) {
  for (const NamedSensor& s : kNamedSensors) {
    if (s.sensor_type == sensor_type) return s.name;
  }
  const kernel_sensor* sensor = kernel_sensor_of(smgr_id_by_sensor_type(sensor_type));
  return sensor != nullptr ? sensor->name : "no sensor";
}

std::string sensor_code_name(int32_t code) {
  for (const kernel_sensor& s : kKernelSensors) {
    if (s.code == code) return s.name;
  }
  if (code == SENSOR_CODE_RAW) return "raw data";
  return code == SENSOR_CODE_NONE ? "no sensor" : "unknown code";
}

}  // namespace kestrelctl
