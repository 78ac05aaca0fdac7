// SPDX-License-Identifier: Apache-2.0
#include "sample_conversion.h"

#include <cmath>

#include "kernel_sensors.h"

namespace {

// 1/65536: the sensor manager's Q16 fixed point.
constexpr double kQ16 = 1.52587890625e-5;
// Accelerometer counts to the kernel's unit, applied in single precision.
constexpr float kAccelScale = 417.67575f;
// Gyroscope and magnetometer scales, in double precision.
constexpr double kGyroScale = 0.06119849462134102;
constexpr double kMagScale = 0.01017252595324357;

// A(n): the product is taken in single precision and only then widened.
double accel(int32_t n) {
  return static_cast<double>(static_cast<float>(n) * kAccelScale);
}

// M(n): n goes through single precision, the product is taken in double.
double mag(int32_t n) {
  return static_cast<double>(static_cast<float>(n)) * kMagScale;
}

double q16(int32_t n) {
  return static_cast<double>(n) * kQ16;
}

int16_t low_half(int32_t n) {
  return static_cast<int16_t>(static_cast<uint16_t>(n & 0xffff));
}

}  // namespace

int16_t to_frame_value(double v) {
  int32_t i;
  if (std::isnan(v)) {
    i = 0;
  } else if (v >= 2147483648.0) {
    i = INT32_MAX;
  } else if (v <= -2147483649.0) {
    i = INT32_MIN;
  } else {
    i = static_cast<int32_t>(v);  // truncates toward zero, in range by the tests above
  }
  return low_half(i);
}

void convert_sample(uint8_t sensor_id, uint8_t data_type, int32_t x, int32_t y, int32_t z,
                    const mag_sensitivity_values& sensitivity, sample_frame* frame) {
  *frame = sample_frame{};
  int16_t* v = frame->value;
  if (data_type == 1) {
    frame->code = SENSOR_CODE_RAW;
    v[0] = to_frame_value(q16(x));
    v[1] = to_frame_value(q16(y));
    v[2] = to_frame_value(q16(z));
    return;
  }
  frame->code = pdata_sensor_type(sensor_id);
  // The accelerometer, gyroscope and magnetometer are mounted with x and y swapped and z
  // reversed against the kernel's axes.
  switch (sensor_id) {
    case kSmgrAccel:
      v[0] = to_frame_value(accel(y) * kQ16);
      v[1] = to_frame_value(accel(x) * kQ16);
      v[2] = to_frame_value(-(accel(z) * kQ16));
      break;
    case kSmgrGyro:
      v[0] = to_frame_value(static_cast<double>(y) * kGyroScale);
      v[1] = to_frame_value(static_cast<double>(x) * kGyroScale);
      v[2] = to_frame_value(-(static_cast<double>(z) * kGyroScale));
      break;
    case kSmgrMag:
      // Each axis by its own sensitivity; a sensitivity still 0 gives an infinite quotient,
      // which saturates (or 0/0, which gives 0).
      v[0] = to_frame_value(mag(y) / static_cast<double>(sensitivity.y));
      v[1] = to_frame_value(mag(x) / static_cast<double>(sensitivity.x));
      v[2] = to_frame_value(-mag(z) / static_cast<double>(sensitivity.z));
      break;
    case kSmgrLight:
      v[0] = to_frame_value(1.0 + static_cast<double>(x) * -kQ16);
      break;
    case kSmgrId60:
      v[0] = to_frame_value(q16(x));
      v[1] = to_frame_value(q16(y));
      v[2] = to_frame_value(q16(z));
      v[3] = low_half(x);
      v[4] = low_half(y);
      v[5] = low_half(z);
      break;
    default:  // the pressure sensor and unknown ids: the code alone
      break;
  }
}
