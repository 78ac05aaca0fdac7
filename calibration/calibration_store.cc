// SPDX-License-Identifier: Apache-2.0
// Command 6: asks the sensor manager to run one sensor's calibration test and store the result,
// waits for its completion and tells the kernel driver whether it came (frame type 7). The
// test's outcome itself reaches factory_results through the service callback.
#include "calibration_store.h"

#include <stddef.h>

#include "byte_order.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "requests/request_pattern.h"
#include "requests/sensor_tables.h"
#include "sensor1_messages.h"
#include "service_link/factory_state.h"

namespace {

constexpr const char* kName = "store_calib_data";
constexpr uint16_t kTestRequestSize = sizeof(single_sensor_test_request);

// TestType by sensor: the accelerometer and the light sensor choose by the command's flag.
constexpr uint32_t kTestTypeFlagSet = 7;
constexpr uint32_t kTestTypeFlagClear = 8;
constexpr uint32_t kTestTypeMag = 0;

}  // namespace

int store_calib_data(const uint8_t* frame) {
  // Before the request exists, so no completion of this request can be overwritten.
  set_test_status(-1);
  KLOGI("%s: Enter\n", kName);
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  const int32_t smgr_id = smgr_id_by_sensor_type(sensor_type);
  const int32_t pdata = pdata_sensor_type(smgr_id);
  KLOGE("%s: sensor_type = %d \n", kName, sensor_type);

  sensor1_request req;
  if (!begin_request(&req, kName, sensor_type, kServiceSmgr, kMsgSmgrSingleSensorTest,
                     kTestRequestSize, kTxnSingleSensorTest, alloc_failure_text::kBracketed)) {
    return -1;
  }
  write_test_request(req.body, smgr_id, 1, 1, 1, 1);
  uint32_t test_type = kTestTypeOther;
  if (smgr_id == kSmgrAccel || smgr_id == kSmgrLight) {
    const int32_t flag = load_i32(frame, kArgumentOffset);
    KLOGI("%s: CAL(%d)", kName, flag);
    test_type = flag == 0 ? kTestTypeFlagClear : kTestTypeFlagSet;
  } else if (smgr_id == kSmgrMag) {
    test_type = kTestTypeMag;
  }
  write_test_type(req.body, test_type);
  KLOGI("%s: SensorID:%d, DataType:%d", kName, test_request_sensor_id(req.body),
        load_u8(req.body, offsetof(single_sensor_test_request, data_type)));

  if (!write_request_or_close(&req)) return -1;

  const int32_t answered = wait_for_answer(kName);
  store_calib_reply reply = {};
  reply.pdata_sensor_type = pdata;
  reply.result = answered != 0 ? 0 : 1;
  send_to_kernel(FRAME_STORE_CALIBRATION, &reply, sizeof reply);
  return reply.result;
}
