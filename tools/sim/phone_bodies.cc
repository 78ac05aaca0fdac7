// SPDX-License-Identifier: Apache-2.0
#include "tools/sim/phone_bodies.h"

namespace kestrel_sim {

namespace {

// One register of a dump and the value the phone's chip holds in it.
struct RegisterValue {
  uint8_t address;
  uint8_t value;
};

// Accelerometer and gyroscope, one chip (LSM6DSM).
constexpr RegisterValue kImuRegisters[] = {
    {0x0F, 0x6A},                              // WHO_AM_I
    {0x10, 0x4C},                              // CTRL1_XL: 104 Hz, 8 g
    {0x11, 0x4C},                              // CTRL2_G: 104 Hz, 2000 dps
    {0x12, 0x44},                              // CTRL3_C: BDU, IF_INC
    {0x1E, 0x07},                              // STATUS: data ready
    {0x20, 0xE0}, {0x21, 0x04},                // OUT_TEMP
    {0x22, 0x03}, {0x24, 0xFE}, {0x25, 0xFF},  // gyroscope x, y, z: close to zero
    {0x26, 0x01},                              //
    {0x28, 0x0C}, {0x2A, 0xF8}, {0x2B, 0xFF},  // accelerometer x, y, z: gravity on z
    {0x2D, 0x10},                              //
};

// Magnetometer (AK09916C).
constexpr RegisterValue kMagRegisters[] = {
    {0x00, 0x48}, {0x01, 0x09},                // WIA1, WIA2
    {0x10, 0x01},                              // ST1
    {0x11, 0x2C}, {0x13, 0xE4}, {0x14, 0xFF},  // HXL, HXH, HYL, HYH, HZL, HZH
    {0x15, 0x8A}, {0x16, 0xFE},                //
    {0x18, 0x18},                              // ST2
    {0x31, 0x08},                              // CNTL2: continuous, 100 Hz
};

// Pressure sensor (LPS22HB).
constexpr RegisterValue kPressureRegisters[] = {
    {0x0F, 0xB1},                              // WHO_AM_I
    {0x10, 0x30},                              // CTRL_REG1: 25 Hz
    {0x11, 0x10},                              // CTRL_REG2: IF_ADD_INC
    {0x27, 0x03},                              // STATUS
    {0x28, 0x00}, {0x29, 0x54}, {0x2A, 0x3F},  // 1013.25 hPa x 4096
    {0x2B, 0xBE}, {0x2C, 0x0A},                // 27.50 degC x 100
};

// Light sensor, registers 0x80 to 0xff.
constexpr RegisterValue kLightRegisters[] = {
    {0x00, 0x03},                              // ENABLE: power on, ALS
    {0x01, 0xF6},                              // ATIME
    {0x0F, 0x01},                              // CONTROL: gain 4x
    {0x12, 0xE0},                              // ID
    {0x13, 0x11},                              // STATUS
    {0x14, 0x16}, {0x15, 0x0D}, {0x16, 0x9C},  // clear, red, green, blue channels
    {0x17, 0x04}, {0x18, 0x8C}, {0x19, 0x05},  //
    {0x1A, 0xF8}, {0x1B, 0x02},                //
};

struct Dump {
  const RegisterValue* values;
  size_t count;
};

template <size_t N>
constexpr Dump dump(const RegisterValue (&values)[N]) {
  return {values, N};
}

// By dump index (txn_id - 169): accelerometer, gyroscope, magnetometer, pressure, light, light.
constexpr Dump kDumps[] = {dump(kImuRegisters),      dump(kImuRegisters),   dump(kMagRegisters),
                           dump(kPressureRegisters), dump(kLightRegisters), dump(kLightRegisters)};
static_assert(sizeof kDumps / sizeof kDumps[0] == kTxnRegisterDumpLast - kTxnRegisterDumpFirst + 1,
              "one dump per register-dump txn_id");

// The sensor-manager ids of the phone, in the order of its state records.
constexpr uint8_t kPhoneSensors[] = {kSmgrAccel,    kSmgrGyro,  kSmgrMag,
                                     kSmgrPressure, kSmgrLight, kSmgrId60};

}  // namespace

std::vector<uint8_t> test_indication_body(uint8_t sensor_id, int32_t test_type, uint32_t result,
                                          uint8_t error_valid, uint8_t error_code,
                                          const std::vector<int32_t>& words) {
  test_indication ind = {};
  ind.sensor_id = sensor_id;
  ind.test_type = test_type;
  ind.result = result;
  ind.error_valid = error_valid;
  ind.error_code = error_code;
  std::copy_n(words.begin(), std::min(words.size(), kTestIndWordCount), ind.words);
  return body_of(ind);
}

std::vector<uint8_t> sample_indication_body(uint8_t sensor_id, uint8_t data_type, int32_t x,
                                            int32_t y, int32_t z) {
  sample_indication ind = {};
  ind.sensor_id = sensor_id;
  ind.data_type = data_type;
  ind.x = x;
  ind.y = y;
  ind.z = z;
  return body_of(ind);
}

std::vector<uint8_t> daf_indication_body(uint8_t code, uint8_t valid, uint32_t length,
                                         const std::array<int32_t, 6>& data) {
  static_assert(std::tuple_size<std::array<int32_t, 6>>::value == kDafIndWordCount, "");
  daf_indication ind = {};
  ind.code = code;
  ind.valid = valid;
  ind.length = length;
  std::copy(data.begin(), data.end(), ind.data);
  return body_of(ind);
}

std::vector<uint8_t> common_response_body(uint8_t result, uint8_t error, size_t size) {
  std::vector<uint8_t> body = body_of(common_response{result, error});
  body.resize(std::max(size, body.size()), 0);
  return body;
}

std::vector<uint8_t> sensor_state_body(const common_response& common) {
  sensor_state_response resp = {};
  resp.common = common;
  for (size_t i = 0; i < kStateRecordCount; ++i) {
    sensor_state_record& rec = resp.records[i];
    if (i >= sizeof kPhoneSensors) {
      rec.type = 255;  // empty
      continue;
    }
    rec.type = kPhoneSensors[i];
    rec.status[0] = 0x01;   // online
    rec.status[1] = 0x00;   // no error
    rec.status[2] = 0x0A;   // reports: one per sensor line
    rec.status[3] = 0x64;   // highest rate, Hz
    rec.status2[0] = 0x01;  // powered
    rec.status2[1] = 0x00;  // no fault
  }
  return body_of(resp);
}

std::vector<uint8_t> report_response_body(const common_response& common, uint8_t sensor_id) {
  report_response resp = {};
  resp.common = common;
  resp.sensor_id = sensor_id;
  return body_of(resp);
}

std::vector<uint8_t> daf_thresholds_body(const common_response& common,
                                         const daf_thresholds& thresholds) {
  daf_response resp = zeroed<daf_response>();
  resp.common = common;
  resp.data.thresholds = thresholds;
  return body_of(resp);
}

std::vector<uint8_t> register_dump_body(const common_response& common, uint8_t txn_id) {
  daf_response resp = zeroed<daf_response>();
  resp.common = common;
  if (txn_id >= kTxnRegisterDumpFirst && txn_id <= kTxnRegisterDumpLast) {
    const Dump& d = kDumps[txn_id - kTxnRegisterDumpFirst];
    for (size_t i = 0; i < d.count; ++i)
      resp.data.registers[d.values[i].address] = d.values[i].value;
  }
  return body_of(resp);
}

}  // namespace kestrel_sim
