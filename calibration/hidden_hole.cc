// SPDX-License-Identifier: Apache-2.0
// The light sensor's data from the kernel driver, passed on to its driver on the sensor processor
// as daf_requests: the hidden-hole coefficients (command 35) and the opaque bulk-data blocks
// (kBigdataKinds). Neither waits: where the driver answers, the service
// callback routes the answer by its transaction id.
#include "hidden_hole.h"

#include "byte_order.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "requests/request_pattern.h"
#include "requests/sensor_tables.h"
#include "sensor1_messages.h"

namespace {

constexpr uint16_t kDafRequestSize = sizeof(daf_request);
constexpr uint32_t kCoefficientCount = 9;  // d_factor .. th_low, from frame offset 20 on
constexpr uint32_t kCoefficientBytes = kCoefficientCount * 4;

// Payload words of command 35 as they are logged: sensor_type, then the coefficients.
constexpr uint32_t kLoggedWordCount = 1 + kCoefficientCount;
constexpr const char* kLoggedWordNames[kLoggedWordCount] = {
    "sensor_type", "d_factor", "r_coef",    "g_coef",  "b_coef",
    "c_coef",      "ct_coef",  "ct_offset", "th_high", "th_low",
};

// The data length of a bulk-data frame, or -1 when the frame cannot be forwarded: the length is
// negative, larger than the request's data field, or runs past the bytes the frame carries.
// The dispatcher has made sure the frame holds the length word and lies inside the datagram.
int32_t bigdata_length(const uint8_t* frame, uint16_t command) {
  const int32_t length = load_i32(frame, kArgumentOffset);
  const uint32_t carried = load_u32(frame, kFrameLenOffset) - kBulkDataOffset;
  if (length < 0 || static_cast<uint32_t>(length) > kDafDataMax ||
      static_cast<uint32_t>(length) > carried) {
    KLOGE("%s: command %u refused: data length %d (frame carries %u bytes, at most %u)",
          "send_bigdata", command, length, carried, static_cast<uint32_t>(kDafDataMax));
    return -1;
  }
  return length;
}

// The callback passes an answer on as the frame its transaction id stands for.
uint8_t bigdata_txn_id(const bigdata_kind& kind) {
  if (kind.reply_frame == FRAME_HD_THRESHOLD) return kTxnHdThreshold;
  if (kind.reply_frame == FRAME_THRESHOLD) return kTxnThreshold;
  return kTxnDaf;
}

}  // namespace

int set_hidden_hole_data(const uint8_t* frame) {
  static const char kName[] = "set_hidden_hole_data";
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  const int32_t smgr_id = smgr_id_by_sensor_type(sensor_type);

  sensor1_request req;
  if (!begin_request(&req, kName, sensor_type, kServiceDaf, kMsgDafRequest, kDafRequestSize,
                     kTxnDaf, alloc_failure_text::kGetRaw)) {
    return -1;
  }
  // "sensor_type:%d", then the nine coefficients, each with the value the kernel driver sent.
  for (uint32_t i = 0; i < kLoggedWordCount; ++i) {
    KLOGI("%s %s:%d\n", kName, kLoggedWordNames[i], load_i32(frame, kSensorTypeOffset + 4 * i));
  }

  write_daf_suid(req.body, light_sensor_suid);
  write_daf_request_id(req.body, kDafHiddenHole);
  // The nine words go over unchanged, in the order the kernel driver sent them.
  write_daf_data(req.body, frame + kArgumentOffset, kCoefficientBytes);

  const int r = write_request(&req);
  if (r != 0) KLOGE("[DAF][%s]sensor1_write -error  %d %d\n", kName, r, sensor_type);
  KLOGI("%s: sensor_type = %d txn_id = %d\n", kName, smgr_id, kTxnDaf);
  return r;
}

int send_bigdata(const uint8_t* frame) {
  static const char kName[] = "send_bigdata";
  const uint16_t command = load_u16(frame, kFrameTypeOffset);
  const bigdata_kind* kind = bigdata_kind_of(command);
  // Only the bulk-data commands are routed here; any other number has no request id to use.
  if (kind == nullptr) return -1;
  const int32_t length = bigdata_length(frame, command);
  if (length < 0) return -1;

  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  const int32_t smgr_id = smgr_id_by_sensor_type(sensor_type);
  sensor1_request req;
  if (!begin_request(&req, kName, sensor_type, kServiceDaf, kMsgDafRequest, kDafRequestSize,
                     bigdata_txn_id(*kind), alloc_failure_text::kPlain)) {
    return -1;
  }
  KLOGI("%s: type:%d, id:%d", kName, command, smgr_id);

  write_daf_suid(req.body, light_sensor_suid);
  write_daf_request_id(req.body, kind->daf_request_id);
  write_daf_data(req.body, frame + kBulkDataOffset, static_cast<uint32_t>(length));

  const int r = write_request(&req);
  if (r != 0) KLOGE("[DAF][%s]sensor1_write -error  %d %d\n", kName, r, sensor_type);
  return r;
}
