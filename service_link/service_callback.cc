// SPDX-License-Identifier: Apache-2.0
#include "service_callback.h"

#include <pthread.h>
#include <string.h>

#include "byte_order.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "sensor1_messages.h"
#include "service_link/connection.h"
#include "service_link/indications.h"

namespace {

// Held from the building of a register dump frame until its End line, so one dump's frame and
// its 130 lines never interleave with another's.
pthread_mutex_t register_dump_lock = PTHREAD_MUTEX_INITIALIZER;

constexpr uint8_t kStateRecordEmpty = 255;
constexpr size_t kRegisterCount = kDafRegisterCount;
// Dumps 4 and 5 hold the upper half of their device's register space.
constexpr uint8_t kFirstUpperHalfDump = 4;

// A state record is read up to its byte 13.
constexpr uint32_t kStateRecordRead = 14;
constexpr uint32_t state_record_end(size_t i) {
  return kStateRecordsOffset + i * kStateRecordSize + kStateRecordRead;
}

bool is_register_dump(uint8_t txn_id) {
  return txn_id >= kTxnRegisterDumpFirst && txn_id <= kTxnRegisterDumpLast;
}

// Bytes a response needs on its path. The data rows relay their words whatever the result byte
// says; every other row chooses its path by the result byte, and only logs the rest.
body_need required_response_size(const sensor1_msg_header_s& hdr, const uint8_t* body,
                                 uint32_t size) {
  switch (hdr.msg_id) {
    case kMsgSmgrSensorState:
      return {0, state_record_end(kStateRecordCount - 1)};
    case kMsgSmgrCalReset:
      return {0, kRespErrorOffset + 1};
    case kMsgDafRequest:
      if (hdr.txn_id == kTxnThreshold) return {kDafRespLowOffset + 4, kDafRespLowOffset + 4};
      if (hdr.txn_id == kTxnHdThreshold) return {kDafRespHdLowOffset + 4, kDafRespHdLowOffset + 4};
      if (is_register_dump(hdr.txn_id)) {
        return {kDafRespRegistersOffset + kRegisterCount, kDafRespRegistersOffset + kRegisterCount};
      }
      break;
    default:
      break;
  }
  constexpr uint32_t kResult = kRespResultOffset + 1;
  if (size < kResult) return {kResult, kResult};
  if (load_u8(body, kRespResultOffset) != 0) return {kResult, kRespErrorOffset + 1};
  if (hdr.msg_id == kMsgSmgrReport) return {kResult, kReportRespSensorIdOffset + 1};
  return {kResult, kResult};
}

// "%s: Response: %u, Error: %u", when the body holds the error byte.
void log_response_error(const uint8_t* body, uint32_t size) {
  if (size <= kRespErrorOffset) return;
  KLOGE("%s: Response: %u, Error: %u", "rcv_test_msg", unsigned{load_u8(body, kRespResultOffset)},
        unsigned{load_u8(body, kRespErrorOffset)});
}

void log_sensor_states(const uint8_t* body, uint32_t size) {
  for (size_t i = 0; i < kStateRecordCount && state_record_end(i) <= size; ++i) {
    uint8_t record[kStateRecordRead];
    memcpy(record, body + kStateRecordsOffset + i * kStateRecordSize, sizeof record);
    if (record[0] == kStateRecordEmpty) continue;
    KLOGI("STATE: Type-%3d %2x%2x%2x%2x %2x%2x", record[0], unsigned{record[1]},
          unsigned{record[2]}, unsigned{record[3]}, unsigned{record[4]}, unsigned{record[12]},
          unsigned{record[13]});
  }
}

// The light sensor's thresholds: each reply fills its own pair of the frame, the other pair is 0.
void relay_threshold(uint8_t txn_id, const uint8_t* body) {
  threshold_reply_frame frame = {};
  if (txn_id == kTxnThreshold) {
    frame.high = load_i32(body, kDafRespHighOffset);
    frame.low = load_i32(body, kDafRespLowOffset);
    KLOGI("%s: high:%d, low:%d", "rcv_test_msg", frame.high, frame.low);
    send_to_kernel(FRAME_THRESHOLD, &frame, sizeof frame);
  } else {
    frame.hd_high = load_i32(body, kDafRespHdHighOffset);
    frame.hd_low = load_i32(body, kDafRespHdLowOffset);
    KLOGI("%s: hd_high:%d, hd_low:%d", "rcv_test_msg", frame.hd_high, frame.hd_low);
    send_to_kernel(FRAME_HD_THRESHOLD, &frame, sizeof frame);
  }
}

void relay_register_dump(uint8_t txn_id, const uint8_t* body) {
  pthread_mutex_lock(&register_dump_lock);
  register_dump_frame frame;
  frame.index = static_cast<uint8_t>(txn_id - kTxnRegisterDumpFirst);
  memcpy(frame.registers, body + kDafRespRegistersOffset, sizeof frame.registers);
  send_to_kernel(FRAME_REGISTER_DUMP, &frame, sizeof frame);
  const int index = frame.index;
  const unsigned first_address = frame.index >= kFirstUpperHalfDump ? kRegisterCount : 0;
  KLOGI("+++++++++++ Print Register Dump for %d Start +++++++++++", index);
  for (unsigned i = 0; i < kRegisterCount; ++i) {
    KLOGI("+++++++++++ Reg_addr[0x%2x] : value[0x%2x] +++++++++++", first_address + i,
          unsigned{frame.registers[i]});
  }
  KLOGI("+++++++++++ Print Register Dump for %d End +++++++++++", index);
  pthread_mutex_unlock(&register_dump_lock);
}

void handle_daf_response(const sensor1_msg_header_s& hdr, const uint8_t* body, uint32_t size) {
  if (hdr.txn_id == kTxnThreshold || hdr.txn_id == kTxnHdThreshold) {
    relay_threshold(hdr.txn_id, body);
    return;
  }
  if (is_register_dump(hdr.txn_id)) {
    relay_register_dump(hdr.txn_id, body);
    return;
  }
  if (load_u8(body, kRespResultOffset) != 0) {
    log_response_error(body, size);
  } else if (hdr.service_number != kServiceDaf) {
    KLOGE("%s: service_number:%u", "rcv_test_msg", hdr.service_number);
  }
}

// Service 13's register-read answer. Its one parsable id, 32, is taken by the driver-access row
// of the dispatch before this step, so every id that arrives here is one it cannot parse.
void process_smgr_register_read_resp(const sensor1_msg_header_s& hdr) {
  KLOGI("%s: Enter", "process_smgr_register_read_resp");
  KLOGE("%s: Cannot parse msg id %d", "process_smgr_register_read_resp", hdr.msg_id);
}

void handle_response(const sensor1_msg_header_s& hdr, const uint8_t* body, uint32_t size) {
  switch (hdr.msg_id) {
    case kMsgSmgrSensorState:
      log_sensor_states(body, size);
      return;
    case kMsgSmgrCalReset:
      if (size > kRespErrorOffset) {
        KLOGI("SNS_SMGR_CAL_RESET_RESP_V01 - %u, %u", unsigned{load_u8(body, kRespResultOffset)},
              unsigned{load_u8(body, kRespErrorOffset)});
      }
      return;
    case kMsgDafRequest:
      handle_daf_response(hdr, body, size);
      return;
    default:
      break;
  }
  const uint8_t result = load_u8(body, kRespResultOffset);
  if (result != 0) {
    log_response_error(body, size);
    return;
  }
  if (hdr.service_number == kServiceRegisterRead) process_smgr_register_read_resp(hdr);
  if (hdr.msg_id == kMsgSmgrReport && size > kReportRespSensorIdOffset) {
    KLOGE("SNS_SMGR_REPORT_REQ_V01 - SensorId = %d txn_id = %d Report id=%d status = %d",
          load_u8(body, kReportRespSensorIdOffset), hdr.txn_id, result,
          load_u8(body, kRespErrorOffset));
  }
}

}  // namespace

void init_callback_locks() {
  init_indication_lock();
  pthread_mutex_init(&register_dump_lock, nullptr);
}

body_need required_body_size(int msg_type, const sensor1_msg_header_s& hdr, const void* body) {
  const uint8_t* bytes = static_cast<const uint8_t*>(body);
  const uint32_t size = body != nullptr ? hdr.msg_size : 0;
  switch (msg_type) {
    case kMsgTypeResponse:
      return required_response_size(hdr, bytes, size);
    case kMsgTypeIndication:
      return required_indication_size(hdr, bytes, size);
    default:
      return {0, 0};
  }
}

// The callback data is the address of the process's handle variable; the handle is read through
// current_sensor1_handle(), which loads that same variable, at the moment the body is released.
void rcv_test_msg(intptr_t /*cb_data*/, sensor1_msg_header_s* msg_hdr, int msg_type, void* msg) {
  if (msg_hdr == nullptr) {
    // Without a header the body's owner is unknown: it is left alone.
    KLOGE("%s: received NULL msg_hdr_ptr! type: %i", "rcv_test_msg", msg_type);
    return;
  }
  const sensor1_msg_header_s hdr = *msg_hdr;
  const uint8_t* body = static_cast<const uint8_t*>(msg);
  const uint32_t size = msg != nullptr ? hdr.msg_size : 0;
  const body_need need = required_body_size(msg_type, hdr, msg);

  // A body without what is stored, relayed or chooses the path is refused; one without only
  // what is logged is handled, and its lines show what it holds.
  if (size < need.handled) {
    KLOGE("%s: type %d service %u msg_id %d txn %u: body of %u bytes, needs %u", "rcv_test_msg",
          msg_type, hdr.service_number, hdr.msg_id, unsigned{hdr.txn_id}, size, need.handled);
  } else {
    if (size < need.logged) {
      KLOGE("%s: type %d service %u msg_id %d txn %u: body of %u bytes, its log lines need %u",
            "rcv_test_msg", msg_type, hdr.service_number, hdr.msg_id, unsigned{hdr.txn_id}, size,
            need.logged);
    }
    switch (msg_type) {
      case kMsgTypeResponse:
        handle_response(hdr, body, size);
        break;
      case kMsgTypeIndication:
        handle_indication(hdr, body, size);
        break;
      case kMsgTypeBrokenPipe:
        handle_broken_pipe();
        break;
      case kMsgTypeRetryOpen:
        handle_retry_open();
        break;
      default:
        KLOGW("%s: Received unknown message type: %d", "rcv_test_msg", msg_type);
        break;
    }
  }

  // After a broken link the current handle is the new one, or empty.
  if (msg != nullptr) {
    sensor1_handle_s* handle = lend_handle(current_sensor1_handle());
    sensor1_free_msg_buf(handle, msg);
    return_handle(handle);
  }
}
