// SPDX-License-Identifier: Apache-2.0
// Start and stop of raw-data streams. The sensor manager streams a periodic report, added and
// deleted by report id; the light sensor (sensor_types 4 and 5) is polled by its driver, started
// and stopped through the driver access service.
#include "raw_data.h"

#include "byte_order.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "request_pattern.h"
#include "sensor1_messages.h"
#include "sensor_tables.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "status_requests.h"

namespace {

constexpr int32_t kMagSensorType = 2;
constexpr uint16_t kRateMag = 50;
constexpr uint16_t kRateDefault = 100;
constexpr int32_t kReportIdBase = 5;  // report id = sensor-manager id + 5

// Report request fields besides those named in sensor1_messages.h.
constexpr size_t kReportFlagOffset = 4;
constexpr size_t kReportItemCountOffset = 8;
constexpr size_t kItemSensorIdOffset = kReportItemOffset + 0;
constexpr size_t kItemDataTypeOffset = kReportItemOffset + 1;
constexpr size_t kItemSensitivityOffset = kReportItemOffset + 3;  // byte 15, always 3
constexpr size_t kOptionListLengthOffset = 4;
constexpr size_t kOptionListEntryOffset = 8;

constexpr uint32_t kLightStreamData = 10000;
constexpr uint32_t kLightStopData = 100000;

// Both used only on the main thread.
bool mag_sensitivity_initialized = false;
bool mag_cal_reset_done = false;

bool is_light_sensor_type(int32_t sensor_type) {
  return sensor_type == SENSOR_TYPE_LIGHT || sensor_type == SENSOR_TYPE_LIGHT_SHORT;
}

uint8_t report_id(int32_t smgr_id) {
  return static_cast<uint8_t>(smgr_id + kReportIdBase);
}

// The first magnetometer stream of the process starts with neutral sensitivities, and every
// stream after a stop starts from a fresh calibration.
void prepare_mag_stream() {
  if (!mag_sensitivity_initialized) {
    mag_sensitivity_initialized = true;
    set_mag_sensitivity(1.0f, 1.0f, 1.0f);
  }
  if (!mag_cal_reset_done) {
    KLOGI("%s: Reset Mag Cal IN", "get_raw_data");
    reset_mag_cal();
    mag_cal_reset_done = true;
    KLOGI("%s: Reset Mag Cal OUT", "get_raw_data");
  }
}

// SNS_SMGR_REPORT_REQ_V01 adding one report of one sensor. Bytes 13 to 31 of the item other
// than byte 15, and the room for further items (32 to 211), stay zero.
void fill_report_add(void* body, int32_t sensor_type, int32_t smgr_id) {
  store_u8(body, kReportIdOffset, report_id(smgr_id));
  store_u8(body, kReportActionOffset, kReportActionAdd);
  store_u16(body, kReportRateOffset, sensor_type == kMagSensorType ? kRateMag : kRateDefault);
  store_u8(body, kReportFlagOffset, 1);
  store_u32(body, kReportItemCountOffset, 1);
  store_u8(body, kItemSensorIdOffset, static_cast<uint8_t>(smgr_id));
  store_u8(body, kItemDataTypeOffset, 0);
  store_u8(body, kItemSensitivityOffset, 3);

  store_u8(body, kReportOptionList1Offset, 1);
  store_u32(body, kReportOptionList1Offset + kOptionListLengthOffset, 1);
  store_u8(body, kReportOptionList1Offset + kOptionListEntryOffset, sensor_type == 0 ? 1 : 2);
  // Only the accelerometer's report carries the second option list.
  if (sensor_type == 0) {
    store_u8(body, kReportOptionList2Offset, 1);
    store_u32(body, kReportOptionList2Offset + kOptionListLengthOffset, 1);
    store_u16(body, kReportOptionList2Offset + kOptionListEntryOffset, 1);
  }
}

void fill_report_delete(void* body, int32_t smgr_id) {
  store_u8(body, kReportIdOffset, report_id(smgr_id));
  store_u8(body, kReportActionOffset, kReportActionDelete);
}

// The light sensor's polling run, started or stopped: the request id of the sensor_type and one
// 32-bit data word.
void fill_light_request(void* body, uint32_t daf_request_id, uint32_t data) {
  write_daf_suid(body, light_sensor_suid);
  write_daf_request_id(body, daf_request_id);
  uint8_t bytes[4];
  store_u32(bytes, 0, data);
  write_daf_data(body, bytes, sizeof bytes);
}

// Starts or stops the light sensor's polling run through the driver access service. A failed
// write is logged and the operation carries on; false when no body could be had.
bool send_light_request(sensor1_request* req, const char* name, int32_t sensor_type,
                        uint32_t daf_request_id, uint32_t data) {
  if (!begin_request(req, name, sensor_type, kServiceDaf, kMsgDafRequest, sizeof(daf_request),
                     kTxnDaf, alloc_failure_text::kGetRaw)) {
    return false;
  }
  KLOGI("%s sensor_type:%d\n", name, sensor_type);
  fill_light_request(req->body, daf_request_id, data);
  const int r = write_request(req);
  if (r != 0) KLOGE("[DAF][%s]sensor1_write -error  %d %d\n", name, r, sensor_type);
  return true;
}

bool begin_report_request(sensor1_request* req, const char* name, int32_t sensor_type) {
  return begin_request(req, name, sensor_type, kServiceSmgr, kMsgSmgrReport, kReportRequestSize,
                       kTxnReport, alloc_failure_text::kBracketed);
}

}  // namespace

int get_raw_data(const uint8_t* frame) {
  const char* const name = "get_raw_data";
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  const int32_t smgr_id = smgr_id_by_sensor_type(sensor_type);
  sensor1_request req;
  if (is_light_sensor_type(sensor_type)) {
    const uint32_t id =
        sensor_type == SENSOR_TYPE_LIGHT ? kDafLightStreamStart : kDafLightShortStart;
    if (!send_light_request(&req, name, sensor_type, id, kLightStreamData)) return -1;
  } else {
    if (!begin_report_request(&req, name, sensor_type)) return -1;
    // The calibration reset goes out while the report body is already allocated; the
    // sensitivities are in place before the report starts, so its first samples see them.
    if (sensor_type == kMagSensorType) {
      prepare_mag_stream();
      // A reset whose write failed has closed the connection the body was taken on: the report
      // is not written on the closed handle but taken anew, on the connection that opens next.
      if (req.handle != current_sensor1_handle()) {
        abandon_request(&req);
        if (!begin_report_request(&req, name, sensor_type)) return -1;
      }
    }
    fill_report_add(req.body, sensor_type, smgr_id);
    const int r = write_request(&req);
    if (r != 0) KLOGE("[%s]sensor1_write -error  %d\n", name, r);
  }
  KLOGI("%s: sensor_type = %d txn_id = %d\n", name, smgr_id, req.header.txn_id);
  return 0;
}

int stop_raw_data(const uint8_t* frame) {
  const char* const name = "stop_raw_data";
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  const int32_t smgr_id = smgr_id_by_sensor_type(sensor_type);
  sensor1_request req;
  if (is_light_sensor_type(sensor_type)) {
    const uint32_t id = sensor_type == SENSOR_TYPE_LIGHT ? kDafLightStreamStop : kDafLightShortStop;
    if (!send_light_request(&req, name, sensor_type, id, kLightStopData)) return -1;
  } else {
    if (!begin_report_request(&req, name, sensor_type)) return -1;
    fill_report_delete(req.body, smgr_id);
    const int r = write_request(&req);
    if (r != 0) KLOGE("[%s]sensor1_write -error  %d %d\n", name, r, sensor_type);
    if (sensor_type == kMagSensorType) mag_cal_reset_done = false;
  }
  KLOGI("%s: sensor_type = %d txn_id = %d\n", name, smgr_id, req.header.txn_id);
  // The kernel hears of the stop even when the request could not be written.
  stop_reply reply = {};
  reply.code = pdata_sensor_type(smgr_id);
  send_to_kernel(FRAME_STOP_RAW_DATA, &reply, sizeof reply);
  return 0;
}

void reset_raw_data_flags_for_testing() {
  mag_sensitivity_initialized = false;
  mag_cal_reset_done = false;
}
