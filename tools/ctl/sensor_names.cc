#include "sensor_names.h"

namespace kestrelctl {
namespace {

struct NamedSensor {
  const char* name;
  const char* long_name;
  int32_t sensor_type;
};

constexpr NamedSensor kNamedSensors[] = {
    {"accel", "accelerometer", 0}, {"gyro", "gyroscope", 1}, {"mag", "magnetometer", 2},
    {"pressure", "pressure", 3},   {"light", "light", 4},    {"light-short", "light-short", 5},
};

// The daemon's sensor-manager id of each sensor_type.
constexpr int32_t kSmgrIdBySensorType[16] = {0,  10, 20, 30, 40, 40, 60, -1,
                                             20, 20, -1, 10, 0,  0,  0,  0};

int digit_value(char c, int base) {
  int d = -1;
  if (c >= '0' && c <= '9') d = c - '0';
  if (c >= 'a' && c <= 'f') d = c - 'a' + 10;
  if (c >= 'A' && c <= 'F') d = c - 'A' + 10;
  return d < base ? d : -1;
}

std::string smgr_sensor_name(int32_t id) {
  switch (id) {
    case 0:
      return "accel";
    case 10:
      return "gyro";
    case 20:
      return "mag";
    case 30:
      return "pressure";
    case 40:
      return "light";
    case 60:
      return "sensor 60";
    default:
      return "no sensor";
  }
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

int32_t smgr_id_of(int32_t sensor_type) {
  if (sensor_type < 0 || sensor_type > 15) return -1;
  return kSmgrIdBySensorType[sensor_type];
}

std::string sensor_type_name(int32_t sensor_type) {
  for (const NamedSensor& s : kNamedSensors) {
    if (s.sensor_type == sensor_type) return s.name;
  }
  return smgr_sensor_name(smgr_id_of(sensor_type));
}

std::string sensor_code_name(int32_t code) {
  switch (code) {
    case 0:
      return "accel";
    case 1:
      return "gyro";
    case 2:
      return "mag";
    case 3:
      return "pressure";
    case 4:
      return "raw data";
    case 5:
      return "light";
    case 6:
      return "sensor 60";
    case -1:
      return "no sensor";
    default:
      return "unknown code";
  }
}

}  // namespace kestrelctl
