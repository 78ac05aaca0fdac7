// SPDX-License-Identifier: Apache-2.0
// Factory self tests run inside the sensor manager, and the two gyroscope replies built from
// their result words.
#include "selftest.h"

#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "request_pattern.h"
#include "sensor1_messages.h"
#include "sensor_tables.h"
#include "service_link/factory_state.h"

namespace {

constexpr uint32_t kGyroTemperatureTest = 11;  // the selector of command 10

// Word 0 of gyro_result: which gyroscope test the words hold.
constexpr int32_t kGyroWordsSelftest = 1;
constexpr int32_t kGyroWordsTemperature = 2;

// Writes TestType for the test type and logs the chip line where the test has one.
void write_selftest_type(void* body, uint32_t test_type) {
  const char* const name = "get_selftest_result";
  uint32_t kind = kTestTypeOther;
  switch (test_type) {
    case 0:
      kind = kTestTypeSelftest;
      KLOGI("%s: LSM6DSM ACCEL SELFTEST, TestType = (%d)\n", name, static_cast<int>(kind));
      break;
    case 1:
      kind = kTestTypeSelftest;
      KLOGI("%s: LSM6DSM GYRO SELFTEST\n", name);
      break;
    case 2:
      kind = kTestTypeSelftest;
      KLOGI("%s: AK09916C MAG SELFTEST, TestType = (%d)\n", name, static_cast<int>(kind));
      break;
    case 3:
      kind = kTestTypeSelftest;
      KLOGI("%s: LPS22HB PRESSURE EEPROM, TestType = (%d)\n", name, static_cast<int>(kind));
      break;
    case kGyroTemperatureTest:
      kind = kTestTypeGyroTemperature;
      KLOGI("%s: LSM6DSM GYRO TEMPERATURE\n", name);
      break;
    default:
      break;
  }
  write_test_type(body, kind);
}

// |a - b| with the subtraction and the negation wrapping in 32 bits.
int32_t abs_difference(int32_t a, int32_t b) {
  uint32_t d = static_cast<uint32_t>(a) - static_cast<uint32_t>(b);
  if (static_cast<int32_t>(d) < 0) d = 0u - d;
  return static_cast<int32_t>(d);
}

}  // namespace

int get_selftest_result(uint32_t test_type) {
  const char* const name = "get_selftest_result";
  set_test_status(-1);
  const int32_t smgr_id = smgr_id_by_sensor_type(static_cast<int32_t>(test_type));
  KLOGI("%s: sensor_type = %d, id = %d\n", name, static_cast<int32_t>(test_type), smgr_id);

  // The gyroscope temperature asks for the handle as the gyroscope's sensor_type.
  const int32_t handle_arg =
      test_type == kGyroTemperatureTest ? 1 : static_cast<int32_t>(test_type);
  sensor1_request req;
  if (!begin_request(&req, name, handle_arg, kServiceSmgr, kMsgSmgrSingleSensorTest,
                     sizeof(single_sensor_test_request), kTxnSingleSensorTest,
                     alloc_failure_text::kBracketed)) {
    return -1;
  }
  write_test_request(req.body, smgr_id, 1, 1, 0, 0);
  write_selftest_type(req.body, test_type);
  KLOGI("%s: msg_hdr.msg_id = 0x%x, id = %u\n", name, kMsgSmgrSingleSensorTest,
        test_request_sensor_id(req.body));
  if (!write_request_or_close(&req)) return -1;
  return wait_for_answer(name);
}

void send_gyro_selftest_result() {
  const char* const name = "send_gyro_selftest_result";
  const factory_results results = factory_state();
  const int32_t* g = results.gyro_result;
  gyro_reply reply = {};
  if (g[0] == kGyroWordsTemperature) {
    KLOGI("%s: test type %d\n", name, g[0]);
    reply.word[0] = 11;
    reply.word[1] = static_cast<int32_t>(static_cast<double>(g[1]) * 1.52587890625e-5);
    send_to_kernel(FRAME_GYRO_TEMPERATURE, &reply, sizeof reply);
  } else if (g[0] == kGyroWordsSelftest) {
    KLOGI("%s: test type %d\n", name, g[0]);
    KLOGI("%s: %d, %d, %d, %d, %d, %d, %d, %d, %d, %d, %d\n", name, g[1], g[2], g[3], g[4], g[5],
          g[6], g[7], g[8], g[9], g[10], g[11]);
    reply.word[0] = 1;
    reply.word[1] = g[1];
    reply.word[2] = g[5];
    reply.word[3] = g[2] / 1000;
    reply.word[4] = g[3] / 1000;
    reply.word[5] = g[4] / 1000;
    for (int i = 6; i <= 11; ++i) reply.word[i] = g[i];
    reply.word[12] = abs_difference(g[9], g[6]);
    reply.word[13] = abs_difference(g[10], g[7]);
    reply.word[14] = abs_difference(g[11], g[8]);
    send_to_kernel(FRAME_GYRO_SELFTEST, &reply, sizeof reply);
  } else {
    KLOGI("%s: wrong test type %d\n", name, g[0]);
  }
}
