// SPDX-License-Identifier: Apache-2.0
#include "dispatcher_commands.h"

#include <pthread.h>

#include "byte_order.h"
#include "diag/diag_logging.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "netlink_channel.h"
#include "requests/register_access.h"
#include "requests/selftest.h"
#include "requests/sensor_tables.h"
#include "requests/status_requests.h"
#include "sensor1_messages.h"
#include "service_link/factory_state.h"
#include "shell_command.h"

namespace {

pthread_t logging_thread_handle;

// Kernel frame type 9: the self-test reply of the accelerometer, magnetometer or pressure sensor,
// built from what factory_results holds when the test returned.
void send_selftest_reply(int32_t smgr_id) {
  const factory_results r = factory_state();
  selftest_reply reply = {};
  switch (smgr_id) {
    case kSmgrAccel:
      reply.word[0] = 0;
      reply.word[1] = r.accel_result[0];
      reply.word[2] = r.accel_result[4];
      reply.word[3] = r.accel_result[5];
      reply.word[4] = r.accel_result[6];
      reply.word[5] = r.accel_result[7];
      reply.word[6] = r.accel_result[1];
      reply.word[7] = r.accel_result[2];
      reply.word[8] = r.accel_result[3];
      break;
    case kSmgrMag:
      reply.word[0] = 2;
      reply.word[1] = r.mag_result[0];
      reply.word[2] = r.mag_result[1];
      for (int i = 0; i < 8; ++i) reply.word[9 + i] = r.mag_result[2 + i];
      break;
    case kSmgrPressure:
      reply.word[0] = 3;
      reply.word[1] = r.pressure_result[0];
      reply.word[2] = static_cast<int32_t>(static_cast<double>(r.pressure_result[1]) * 0.01);
      break;
    default:
      return;
  }
  send_to_kernel(FRAME_SELFTEST, &reply, sizeof reply);
}

}  // namespace

void run_selftest_command(const uint8_t* frame) {
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  if (sensor_type < 0 || sensor_type > 15) {
    get_selftest_result(static_cast<uint32_t>(sensor_type));
    return;
  }
  const int32_t id = smgr_id_by_sensor_type(sensor_type);
  switch (id) {
    case kSmgrAccel:
      get_selftest_result(0);
      send_selftest_reply(id);
      break;
    case kSmgrGyro:
      get_selftest_result(1);
      send_gyro_selftest_result();
      break;
    case kSmgrMag:
      get_selftest_result(2);
      KLOGI("%s: id == SNS_SMGR_ID_MAG_V01", "send_mag_selftest_result");
      send_selftest_reply(id);
      reset_mag_cal();
      break;
    case kSmgrPressure:
      get_selftest_result(3);
      send_selftest_reply(id);
      break;
    default:
      get_selftest_result(static_cast<uint32_t>(sensor_type));
      break;
  }
}

void run_accel_lpf_command(int32_t code) {
  set_accel_lpf(code);
  // Only the test type the sensor reports decides the frame, not the command that came in.
  const factory_results r = factory_state();
  const int32_t t = r.accel_result[0];
  int32_t v = r.accel_result[1];
  lpf_result result = {};
  result.lpf_on_off = v;
  if (t == 12) {
    result.code = 13;
    send_to_kernel(FRAME_ACCEL_LPF_OFF, &result, sizeof result);
  } else if (t == 11) {
    result.code = 12;
    send_to_kernel(FRAME_ACCEL_LPF_ON, &result, sizeof result);
  } else {
    v = 0;
  }
  KLOGI("%s OUT: test type = %d, lpf_on_off = %d\n", "send_accel_lpf_result", t, v);
}

void run_dump_register_command(const uint8_t* frame) {
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  if (sensor_type < 6) {
    KLOGI("%s: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (%d)", "process_message", sensor_type);
    dump_register(static_cast<uint32_t>(sensor_type));
  } else {
    KLOGE("%s: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type error", "process_message");
  }
}

void run_diag_logging_command(const uint8_t* frame) {
  const int32_t argument = load_i32(frame, kArgumentOffset);
  if (argument == 1) {
    set_diag_logging_state(diag_state::stopped);
    run_shell_command(kDiagMdlogStop);
  } else if (argument == 0) {
    const diag_state state = diag_logging_state();
    if (state == diag_state::stopped) {
      KLOGI("diag : Diabled Logging System\n");
    } else {
      KLOGI("diag : debugging_mode %x\n", static_cast<int>(state));
      if (state == diag_state::dumping) {
        KLOGI("diag : Logging System is running\n");
      } else {
        set_diag_logging_state(diag_state::dumping);
        KLOGI("diag : To start logging %x\n", static_cast<int>(diag_state::dumping));
        if (pthread_create(&logging_thread_handle, nullptr, diag_logging_thread, nullptr) != 0) {
          KLOGE("%s: logging_thread_handle thread: init err\n", "process_message");
          set_diag_logging_state(diag_state::logging);
        } else {
          KLOGI("%s: logging_thread_handle success \n", "process_message");
        }
        KLOGE("diag : To stop logging %x\n", static_cast<int>(diag_logging_state()));
      }
    }
  }
  get_sensor_state();
}

void run_hh_file_permissions_command() {
  KLOGE("chown : start \n");
  run_shell_command("chown system:radio /efs/FactoryApp/predefine*");
  run_shell_command("chown system:radio /efs/FactoryApp/hh_version");
  run_shell_command("chmod 660 /efs/FactoryApp/predefine*");
  run_shell_command("chmod 660 /efs/FactoryApp/hh_version");
  KLOGE("chown : end\n");
}
