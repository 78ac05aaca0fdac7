// SPDX-License-Identifier: Apache-2.0
// Sample conversion on its own, with nothing but the arithmetic: the rows of each sensor, the
// precision each product is taken in, and T(), whose truncation and saturation a compiler or a
// CPU could get differently (x86-64 and ARM convert an out-of-range double to int differently).
// Part of the device's unit tests, so it also runs on the phone's own CPU.
#include "service_link/sample_conversion.h"

#include <gtest/gtest.h>

#include <limits>
#include <vector>

namespace {

// code, then the six values.
std::vector<int32_t> convert(uint8_t sensor_id, uint8_t data_type, int32_t x, int32_t y, int32_t z,
                             mag_sensitivity_values s = {1.0f, 1.0f, 1.0f}) {
  sample_frame f;
  convert_sample(sensor_id, data_type, x, y, z, s, &f);
  return {f.code, f.value[0], f.value[1], f.value[2], f.value[3], f.value[4], f.value[5]};
}

std::vector<int32_t> first_four(const std::vector<int32_t>& v) {
  return {v[0], v[1], v[2], v[3]};
}

using V = std::vector<int32_t>;

TEST(SampleConversionTest, EachSensorHasItsCodeScaleAndAxisOrder) {
  EXPECT_EQ(first_four(convert(0, 0, 65536, 65536, 65536)), (V{0, 417, 417, -417}));
  EXPECT_EQ(first_four(convert(0, 0, 65536, 131072, 0)), (V{0, 835, 417, 0}));
  EXPECT_EQ(first_four(convert(10, 0, 1000, -1000, 500)), (V{1, -61, 61, -30}));
  EXPECT_EQ(first_four(convert(20, 0, 65536, 65536, 65536)), (V{2, 666, 666, -666}));
  EXPECT_EQ(first_four(convert(20, 0, 65536, 65536, 65536, {0.5f, 1.0f, 0.25f})),
            (V{2, 666, 1333, -2666}));
  EXPECT_EQ(first_four(convert(30, 0, 123456, -5, 9)), (V{3, 0, 0, 0}));
  EXPECT_EQ(convert(40, 0, 32768, 7, 7)[1], 0);
  EXPECT_EQ(convert(40, 0, -65536, 7, 7)[1], 2);
  EXPECT_EQ(convert(40, 0, 32768, 7, 7)[0], 5);
  EXPECT_EQ(convert(60, 0, 131072, -65536, 70000), (V{6, 2, -1, 1, 0, 0, 4464}));
  EXPECT_EQ(first_four(convert(99, 0, 65536, 65536, 65536)), (V{-1, 0, 0, 0}));
  // Data type 1 wins over the sensor id: no swap, no negation.
  EXPECT_EQ(first_four(convert(0, 1, 196608, -65536, 70000)), (V{4, 3, -1, 1}));
  EXPECT_EQ(first_four(convert(20, 1, 196608, -65536, 70000)), (V{4, 3, -1, 1}));
}

TEST(SampleConversionTest, EachProductIsTakenInItsOwnPrecision) {
  // Accelerometer: single precision; in double 328562 would give 2093.99... and so 2093.
  EXPECT_EQ(convert(0, 0, 328562, 0, 0)[2], 2094);
  EXPECT_EQ(convert(0, 0, 0, 0, 328562)[3], -2094);
  // Gyroscope: double; in single precision 15703 would give 961.
  EXPECT_EQ(convert(10, 0, 15703, 0, 0)[2], 960);
  // Magnetometer: the word goes through single precision first (16777249 becomes 16777248):
  // 170666, whose low half is -25942, where the exact word would give 170667.
  EXPECT_EQ(convert(20, 0, 16777249, 0, 0)[2], -25942);
}

TEST(SampleConversionTest, FrameValueTruncatesSaturatesAndKeepsTheLowHalf) {
  struct Case {
    double v;
    int16_t expected;
  };
  const double inf = std::numeric_limits<double>::infinity();
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const Case cases[] = {
      // Toward zero, then the low 16 bits.
      {2.9, 2},
      {-2.9, -2},
      {-0.99, 0},
      {32767.99, 32767},
      {32768.0, -32768},
      {-32769.0, 32767},
      {70000.0, 4464},
      // INT32_MAX, and what saturates to it: 0x7fffffff, whose low half is -1.
      {2147483647.9, -1},
      {2147483648.0, -1},
      {1e10, -1},
      {inf, -1},
      // INT32_MIN, and what saturates to it: 0x80000000, whose low half is 0. NaN gives 0.
      {-2147483648.9, 0},
      {-2147483649.0, 0},
      {-1e10, 0},
      {-inf, 0},
      {nan, 0},
  };
  for (const Case& c : cases) EXPECT_EQ(to_frame_value(c.v), c.expected) << c.v;
}

TEST(SampleConversionTest, ZeroMagnetometerSensitivitySaturates) {
  // x / 0 is +infinity, -y / 0 is -infinity and 0 / 0 is NaN, with the axes swapped.
  EXPECT_EQ(first_four(convert(20, 0, 65536, -65536, 0, {0.0f, 0.0f, 0.0f})), (V{2, 0, -1, 0}));
}

}  // namespace
