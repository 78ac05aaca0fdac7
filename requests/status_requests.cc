// SPDX-License-Identifier: Apache-2.0
// The three small requests of the sensor manager: its sensor-state table, the status of one
// sensor, and the magnetometer calibration reset.
#include "status_requests.h"

#include "byte_order.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "request_pattern.h"
#include "sensor1_messages.h"
#include "sensor_tables.h"

namespace {

constexpr uint16_t kSensorStateRequestSize = sizeof(sensor_state_request);
constexpr uint16_t kStatusRequestSize = sizeof(status_request);
constexpr uint16_t kCalResetRequestSize = sizeof(cal_reset_request);
// The status request names a sensor outside the table by this id.
constexpr int32_t kStatusOutOfRange = 255;

}  // namespace

int get_sensor_state() {
  sensor1_request req;
  if (!begin_request(&req, "get_sensor_state", 0, kServiceSmgr, kMsgSmgrSensorState,
                     kSensorStateRequestSize, kTxnSensorState, alloc_failure_text::kBracketed)) {
    return -1;
  }
  store_u8(req.body, 0, kSensorStateMagic);
  // The answer is only logged by the service callback; nobody waits for it.
  return write_request_or_close(&req) ? 0 : -1;
}

int get_status(const uint8_t* frame) {
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  sensor1_request req;
  if (!begin_request(&req, "get_status", sensor_type, kServiceSmgr, kMsgSmgrStatus,
                     kStatusRequestSize, kTxnStatus, alloc_failure_text::kBracketed)) {
    return -1;
  }
  store_u8(req.body, 0,
           static_cast<uint8_t>(smgr_id_by_sensor_type(sensor_type, kStatusOutOfRange)));
  if (!write_request_or_close(&req)) return -1;

  // The status response itself raises nothing: only a test indication handed over in time (or
  // one still unconsumed) counts as an answer here.
  const int32_t answered = wait_for_answer("get_status");
  status_reply reply = {};
  reply.sensor_type = static_cast<uint8_t>(sensor_type);
  reply.no_response = answered != 0 ? 0 : 1;
  send_to_kernel(FRAME_STATUS, &reply, sizeof reply);
  return answered;
}

int reset_mag_cal() {
  sensor1_request req;
  if (!begin_request(&req, "reset_mag_cal", kSmgrMag, kServiceSmgr, kMsgSmgrCalReset,
                     kCalResetRequestSize, kTxnCalReset, alloc_failure_text::kBracketed)) {
    return -1;
  }
  store_u8(req.body, 0, 0);
  store_u8(req.body, 1, static_cast<uint8_t>(kSmgrMag));
  store_u8(req.body, 2, 0);
  return write_request_or_close(&req) ? 0 : -1;
}
