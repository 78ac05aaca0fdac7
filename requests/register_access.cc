// SPDX-License-Identifier: Apache-2.0
// Access to sensor internals and device controls: the magnetometer's fuse ROM and registers and
// the accelerometer's low-pass filter through the sensor manager's test request, the motor state
// and the register dumps through the driver access service.
#include "register_access.h"

#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "request_pattern.h"
#include "sensor1_messages.h"
#include "sensor_tables.h"
#include "service_link/factory_state.h"

namespace {

constexpr int32_t kReadFuseRom = 8;
constexpr int32_t kReadRegisters = 9;
constexpr int32_t kMagReplyCode = 2;

constexpr int32_t kLpfOn = 12;
constexpr int32_t kLpfOff = 13;

constexpr int32_t kMotorEnabled = 14;
constexpr int32_t kMotorDisabled = 15;

// The fuse-ROM value of an axis scales its samples by value / 128 + 1.
float sensitivity_of(int32_t fuse_rom) {
  return static_cast<float>(fuse_rom) * 0.0078125f + 1.0f;
}

}  // namespace

int get_mag_register_data(int32_t read_id, int32_t reply) {
  const char* const name = "get_mag_register_data";
  const bool send_reply = (reply & 1) != 0;
  set_test_status(-1);
  int32_t smgr_id = -1;
  int32_t code = -1;
  if (read_id >= 0 && read_id <= 15) {
    smgr_id = smgr_id_by_sensor_type(read_id);
    code = pdata_sensor_type(smgr_id);
  }
  KLOGI("%s: sensor_type = %d, pdata_sensor_type:%d, id=%d, send_to_kernel=%d\n", name, read_id,
        code, smgr_id, send_reply ? 1 : 0);

  sensor1_request req;
  if (!begin_request(&req, name, read_id, kServiceSmgr, kMsgSmgrSingleSensorTest,
                     sizeof(single_sensor_test_request), kTxnSingleSensorTest,
                     alloc_failure_text::kBracketed)) {
    return -1;
  }
  write_test_request(req.body, smgr_id, 0, 0, 0, 0);
  if (read_id == kReadFuseRom) {
    write_test_type(req.body, kTestTypeFuseRom);
    KLOGI("%s: MAG Read Fuserom\n", name);
  } else if (read_id == kReadRegisters) {
    write_test_type(req.body, kTestTypeRegisters);
    KLOGI("%s: MAG Read Registers\n", name);
  } else {
    write_test_type(req.body, kTestTypeOther);
  }
  KLOGI("%s: msg_hdr.msg_id = 0x%x, id = %u\n", name, kMsgSmgrSingleSensorTest,
        test_request_sensor_id(req.body));
  if (!write_request_or_close(&req)) return -1;
  wait_for_answer(name);

  // Without an answer the reply still goes out, from the words a previous read left and the
  // status -1 set above (unless a late indication has changed it meanwhile).
  const int32_t result = test_status();
  const factory_results results = factory_state();
  mag_reply out = {};
  out.code = kMagReplyCode;
  out.result = result;
  if (read_id == kReadRegisters) {
    KLOGI("%s: id == ADSP_FACTORY_MAG_REGISTERS, result(%d)", name, result);
    for (int i = 0; i < 14; ++i) out.registers[i] = static_cast<uint8_t>(results.mag_result[i]);
    if (send_reply) send_to_kernel(FRAME_MAG_REGISTERS, &out, sizeof out);
  } else if (read_id == kReadFuseRom) {
    KLOGI("%s: id == ADSP_FACTORY_MAG_READ_FUSE_ROM, result(%d)", name, result);
    for (int i = 0; i < 3; ++i) out.fuse_rom[i] = results.mag_result[i];
    if (send_reply) {
      send_to_kernel(FRAME_MAG_FUSE_ROM, &out, sizeof out);
    } else {
      set_mag_sensitivity(sensitivity_of(out.fuse_rom[0]), sensitivity_of(out.fuse_rom[1]),
                          sensitivity_of(out.fuse_rom[2]));
    }
  }
  return result;
}

int set_accel_lpf(int32_t code) {
  const char* const name = "set_accel_lpf";
  set_test_status(-1);
  const int32_t smgr_id = smgr_id_by_sensor_type(code);
  KLOGI("%s: sensor_type = %d, id = %d\n", name, code, smgr_id);

  sensor1_request req;
  if (!begin_request(&req, name, 0, kServiceSmgr, kMsgSmgrSingleSensorTest,
                     sizeof(single_sensor_test_request), kTxnSingleSensorTest,
                     alloc_failure_text::kBracketed)) {
    return -1;
  }
  write_test_request(req.body, smgr_id, 1, 1, 0, 0);
  if (code == kLpfOn) {
    write_test_type(req.body, kTestTypeLpfOn);
    KLOGI("%s: K6DS3 ACCEL LPF ON\n", name);
  } else if (code == kLpfOff) {
    write_test_type(req.body, kTestTypeLpfOff);
    KLOGI("%s: K6DS3 ACCEL LPF OFF\n", name);
  } else {
    // Sent all the same, with TestType left as allocated (zero).
    KLOGI("%s: K6DS3 ACCEL LPF ON/OFF invalid sensor type\n", name);
  }
  KLOGI("%s: msg_hdr.msg_id = 0x%x, id = %u\n", name, kMsgSmgrSingleSensorTest,
        test_request_sensor_id(req.body));
  if (!write_request_or_close(&req)) return -1;
  return wait_for_answer(name);
}

int set_accel_motor(int32_t code) {
  const char* const name = "set_accel_motor";
  uint32_t daf_request_id;
  uint8_t state;
  const char* text;
  if (code == kMotorEnabled) {
    daf_request_id = kDafMotorEnabled;
    state = 1;
    text = "Send Motor Enabled state";
  } else if (code == kMotorDisabled) {
    daf_request_id = kDafMotorDisabled;
    state = 0;
    text = "Send Motor Disabled state";
  } else {
    // No request id or state exists for any other code: nothing is asked for or sent.
    KLOGE("%s: invalid motor code %d, no request sent\n", name, code);
    return -1;
  }

  sensor1_request req;
  if (!begin_request(&req, name, 0, kServiceDaf, kMsgDafRequest, sizeof(daf_request), kTxnMotor,
                     alloc_failure_text::kPlain)) {
    return -1;
  }
  write_daf_suid(req.body, accel_suid);
  write_daf_request_id(req.body, daf_request_id);
  write_daf_data(req.body, &state, sizeof state);
  const int r = write_request(&req);
  if (r != 0) KLOGE("[DAF][%s]sensor1_write -error  %d %d\n", name, r, code);
  KLOGI("%s: %s done", name, text);
  return r;
}

int dump_register(uint32_t sensor_type) {
  const char* const name = "dump_register";
  sensor1_request req;
  if (!begin_request(&req, name, static_cast<int32_t>(sensor_type), kServiceDaf, kMsgDafRequest,
                     sizeof(daf_request), kTxnRegisterDumpFirst, alloc_failure_text::kPlain)) {
    return -1;
  }
  // getUUID logs the sensor_types without a SUID and leaves those bytes as they are.
  getUUID(sensor_type, daf_suid_field(req.body));
  write_daf_request_id(req.body, kDafRegisterDump);
  if (sensor_type > kLastDumpSensorType) {
    KLOGE("[DAF][%s] sensor_type error %d\n", name, static_cast<int32_t>(sensor_type));
    abandon_request(&req);
    return -1;
  }
  // The transaction id tells the callback whose dump comes back.
  req.header.txn_id = static_cast<uint8_t>(kTxnRegisterDumpFirst + sensor_type);
  const int r = write_request(&req);
  if (r == 0) {
    KLOGI("%s: send DAF message to slpi", name);
  } else {
    KLOGE("[DAF][%s]sensor1_write error %d\n", name, r);
  }
  return r;
}
