// SPDX-License-Identifier: Apache-2.0
// The sensor1 messages the daemon writes and reads: services, message ids, transaction ids,
// request body layouts and the offsets it reads in responses and indications.
#pragma once

#include <stddef.h>
#include <stdint.h>

// Services.
constexpr uint32_t kServiceSmgr = 0;           // the sensor manager
constexpr uint32_t kServiceRegisterRead = 13;  // never addressed by the daemon
constexpr uint32_t kServiceDaf = 44;           // driver access, one driver by its SUID

// Message ids.
constexpr int32_t kMsgSmgrReport = 2;             // report request / response
constexpr int32_t kMsgSmgrSample = 3;             // sample indication
constexpr int32_t kMsgSmgrStatus = 11;            // sensor status request
constexpr int32_t kMsgSmgrSingleSensorTest = 13;  // test request / test indication
constexpr int32_t kMsgSmgrCalReset = 38;          // calibration reset
constexpr int32_t kMsgSmgrSensorState = 64;       // sensor-state table
constexpr int32_t kMsgDafRequest = 32;            // daf_request / daf_response
constexpr int32_t kMsgDafIndication = 33;         // daf_indication

// Callback message types.
constexpr int kMsgTypeResponse = 1;
constexpr int kMsgTypeIndication = 2;
constexpr int kMsgTypeBrokenPipe = 250;
constexpr int kMsgTypeRetryOpen = 251;

// Transaction ids.
constexpr uint8_t kTxnSensorState = 0;
constexpr uint8_t kTxnReport = 2;
constexpr uint8_t kTxnSingleSensorTest = 4;
constexpr uint8_t kTxnCalReset = 4;
constexpr uint8_t kTxnStatus = 6;
constexpr uint8_t kTxnMotor = 7;
constexpr uint8_t kTxnDaf = 123;
constexpr uint8_t kTxnThreshold = 167;
constexpr uint8_t kTxnHdThreshold = 168;
constexpr uint8_t kTxnRegisterDumpFirst = 169;  // 169 + sensor_type, 0 to 5
constexpr uint8_t kTxnRegisterDumpLast = 174;

// Sensor-manager ids.
constexpr int32_t kSmgrAccel = 0;
constexpr int32_t kSmgrGyro = 10;
constexpr int32_t kSmgrMag = 20;
constexpr int32_t kSmgrPressure = 30;
constexpr int32_t kSmgrLight = 40;
constexpr int32_t kSmgrId60 = 60;

// single-sensor test request: service 0, msg 13, 12 bytes, txn 4.
struct single_sensor_test_request {
  uint8_t sensor_id;
  uint8_t data_type;
  uint8_t unwritten[2];
  uint32_t test_type;
  uint8_t option[4];
};
static_assert(sizeof(single_sensor_test_request) == 12, "");
static_assert(offsetof(single_sensor_test_request, test_type) == 4, "");
static_assert(offsetof(single_sensor_test_request, option) == 8, "");

// daf_request: service 44, msg 32, 288 bytes.
constexpr size_t kDafDataMax = 256;
struct daf_request {
  uint8_t suid[16];
  uint32_t daf_request_id;
  uint8_t flag;  // always 1
  uint8_t unwritten1[3];
  uint32_t data_length;
  uint8_t data[kDafDataMax];
  uint8_t trailing_flag;  // always 0
  uint8_t unwritten2[3];
};
static_assert(sizeof(daf_request) == 288, "");
static_assert(offsetof(daf_request, daf_request_id) == 16, "");
static_assert(offsetof(daf_request, flag) == 20, "");
static_assert(offsetof(daf_request, data_length) == 24, "");
static_assert(offsetof(daf_request, data) == 28, "");
static_assert(offsetof(daf_request, trailing_flag) == 284, "");

// TestType values of the single-sensor test request.
constexpr uint32_t kTestTypeOther = 3;  // status poll, and the calibrations that name no other
constexpr uint32_t kTestTypeSelftest = 6;
constexpr uint32_t kTestTypeFuseRom = 9;
constexpr uint32_t kTestTypeRegisters = 10;
constexpr uint32_t kTestTypeLpfOn = 11;
constexpr uint32_t kTestTypeLpfOff = 12;
constexpr uint32_t kTestTypeGyroTemperature = 13;

// daf_request_id values.
constexpr uint32_t kDafLightStreamStart = 60;
constexpr uint32_t kDafLightStreamStop = 62;
constexpr uint32_t kDafLightShortStart = 50;
constexpr uint32_t kDafLightShortStop = 52;
constexpr uint32_t kDafBigdataFirst = 100001;
constexpr uint32_t kDafHiddenHole = 100010;
constexpr uint32_t kDafMotorEnabled = 100011;
constexpr uint32_t kDafMotorDisabled = 100012;
constexpr uint32_t kDafRegisterDump = 100015;

// SNS_SMGR_REPORT_REQ_V01: service 0, msg 2, 272 bytes, txn 2. Offsets of the written fields.
constexpr uint16_t kReportRequestSize = 272;
constexpr size_t kReportIdOffset = 0;
constexpr size_t kReportActionOffset = 1;
constexpr size_t kReportRateOffset = 2;
constexpr size_t kReportItemOffset = 12;
constexpr size_t kReportOptionList1Offset = 212;
constexpr size_t kReportOptionList2Offset = 232;
constexpr uint8_t kReportActionAdd = 1;
constexpr uint8_t kReportActionDelete = 2;

// SNS_SMGR_REPORT_REQ_V01 as a record: the fields a reader of the request looks at.
struct report_request {
  uint8_t report_id;
  uint8_t action;
  uint16_t report_rate;  // Hz
  uint8_t flag;
  uint8_t unwritten1[3];
  uint32_t item_count;
  uint8_t item_sensor_id;
  uint8_t item_data_type;
  uint8_t unwritten2;
  uint8_t item_sensitivity;
  uint8_t unwritten3[kReportOptionList1Offset - 16];
  uint8_t option_list1[kReportOptionList2Offset - kReportOptionList1Offset];
  uint8_t option_list2[kReportRequestSize - kReportOptionList2Offset];
};
static_assert(sizeof(report_request) == kReportRequestSize, "");
static_assert(offsetof(report_request, report_id) == kReportIdOffset, "");
static_assert(offsetof(report_request, action) == kReportActionOffset, "");
static_assert(offsetof(report_request, report_rate) == kReportRateOffset, "");
static_assert(offsetof(report_request, item_sensor_id) == kReportItemOffset, "");
static_assert(offsetof(report_request, option_list1) == kReportOptionList1Offset, "");

// The three small requests of the sensor manager.
constexpr uint8_t kSensorStateMagic = 0xAA;
struct sensor_state_request {  // msg 64, txn 0
  uint8_t magic;               // kSensorStateMagic
};
struct status_request {  // msg 11, txn 6
  uint8_t sensor_id;
  uint8_t unwritten[2];
};
struct cal_reset_request {  // msg 38, txn 4
  uint8_t zero1;
  uint8_t sensor_id;
  uint8_t zero2;
};
static_assert(sizeof(sensor_state_request) == 1, "");
static_assert(sizeof(status_request) == 3, "");
static_assert(sizeof(cal_reset_request) == 3, "");

// Responses, as read. Every response body begins with result (byte 0) and error (byte 1).
constexpr size_t kRespResultOffset = 0;
constexpr size_t kRespErrorOffset = 1;
constexpr size_t kStateRecordsOffset = 4;
constexpr size_t kStateRecordSize = 16;
constexpr size_t kStateRecordCount = 12;
constexpr size_t kDafRespHighOffset = 12;
constexpr size_t kDafRespLowOffset = 16;
constexpr size_t kDafRespHdHighOffset = 20;
constexpr size_t kDafRespHdLowOffset = 24;
constexpr size_t kDafRespRegistersOffset = 12;
constexpr size_t kReportRespSensorIdOffset = 8;

// The responses as records. The common response opens every one of them.
struct common_response {
  uint8_t result;  // 0 success
  uint8_t error;
};
static_assert(offsetof(common_response, result) == kRespResultOffset, "");
static_assert(offsetof(common_response, error) == kRespErrorOffset, "");

struct sensor_state_record {
  uint8_t type;  // 255: empty
  uint8_t status[4];
  uint8_t unread1[7];
  uint8_t status2[2];
  uint8_t unread2[2];
};
struct sensor_state_response {  // msg 64
  common_response common;
  uint8_t unread[kStateRecordsOffset - sizeof(common_response)];
  sensor_state_record records[kStateRecordCount];
};
static_assert(sizeof(sensor_state_record) == kStateRecordSize, "");
static_assert(offsetof(sensor_state_record, status2) == 12, "");
static_assert(offsetof(sensor_state_response, records) == kStateRecordsOffset, "");

struct report_response {  // msg 2
  common_response common;
  uint8_t unread1[kReportRespSensorIdOffset - sizeof(common_response)];
  uint8_t sensor_id;
  uint8_t unread2[3];
};
static_assert(sizeof(report_response) == 12, "");
static_assert(offsetof(report_response, sensor_id) == kReportRespSensorIdOffset, "");

// daf_response: the txn_id tells whether the data holds thresholds or 128 register bytes.
constexpr size_t kDafRegisterCount = 128;
struct daf_thresholds {
  int32_t high;  // txn 167
  int32_t low;
  int32_t hd_high;  // txn 168
  int32_t hd_low;
};
struct daf_response {
  common_response common;
  uint8_t unread[kDafRespRegistersOffset - sizeof(common_response)];
  union {
    daf_thresholds thresholds;
    uint8_t registers[kDafRegisterCount];
  } data;
};
static_assert(sizeof(daf_response) == kDafRespRegistersOffset + kDafRegisterCount, "");
static_assert(offsetof(daf_response, data.thresholds.high) == kDafRespHighOffset, "");
static_assert(offsetof(daf_response, data.thresholds.low) == kDafRespLowOffset, "");
static_assert(offsetof(daf_response, data.thresholds.hd_high) == kDafRespHdHighOffset, "");
static_assert(offsetof(daf_response, data.thresholds.hd_low) == kDafRespHdLowOffset, "");

// single-sensor test indication, as read.
constexpr size_t kTestIndSensorIdOffset = 0;
constexpr size_t kTestIndTestTypeOffset = 4;
constexpr size_t kTestIndResultOffset = 8;
constexpr size_t kTestIndErrorValidOffset = 12;
constexpr size_t kTestIndErrorCodeOffset = 13;
constexpr size_t kTestIndWordsOffset = 20;

// sample indication, as read.
constexpr size_t kSampleSensorIdOffset = 8;
constexpr size_t kSampleDataTypeOffset = 9;
constexpr size_t kSampleXOffset = 12;
constexpr size_t kSampleYOffset = 16;
constexpr size_t kSampleZOffset = 20;

// daf_indication, as read.
constexpr size_t kDafIndCodeOffset = 0;
constexpr size_t kDafIndValidOffset = 1;
constexpr size_t kDafIndLengthOffset = 4;
constexpr size_t kDafIndDataOffset = 8;
constexpr uint8_t kDafIndAlsRgb = 61;
constexpr uint8_t kDafIndShort = 51;

// The indications as records.
constexpr size_t kTestIndWordCount = 16;
struct test_indication {  // service 0, msg 13
  uint8_t sensor_id;
  uint8_t unread1[3];
  int32_t test_type;
  uint32_t result;  // 0 passed
  uint8_t error_valid;
  uint8_t error_code;
  uint8_t unread2[6];
  int32_t words[kTestIndWordCount];
};
static_assert(sizeof(test_indication) == 84, "");
static_assert(offsetof(test_indication, sensor_id) == kTestIndSensorIdOffset, "");
static_assert(offsetof(test_indication, test_type) == kTestIndTestTypeOffset, "");
static_assert(offsetof(test_indication, result) == kTestIndResultOffset, "");
static_assert(offsetof(test_indication, error_valid) == kTestIndErrorValidOffset, "");
static_assert(offsetof(test_indication, error_code) == kTestIndErrorCodeOffset, "");
static_assert(offsetof(test_indication, words) == kTestIndWordsOffset, "");

struct sample_indication {  // service 0, msg 3
  uint8_t unread[kSampleSensorIdOffset];
  uint8_t sensor_id;
  uint8_t data_type;
  uint8_t unread2[2];
  int32_t x;
  int32_t y;
  int32_t z;
};
static_assert(sizeof(sample_indication) == 24, "");
static_assert(offsetof(sample_indication, sensor_id) == kSampleSensorIdOffset, "");
static_assert(offsetof(sample_indication, data_type) == kSampleDataTypeOffset, "");
static_assert(offsetof(sample_indication, x) == kSampleXOffset, "");
static_assert(offsetof(sample_indication, y) == kSampleYOffset, "");
static_assert(offsetof(sample_indication, z) == kSampleZOffset, "");

constexpr size_t kDafIndWordCount = 6;
struct daf_indication {  // service 44, msg 33
  uint8_t code;
  uint8_t valid;
  uint8_t unread[2];
  uint32_t length;
  int32_t data[kDafIndWordCount];
};
static_assert(sizeof(daf_indication) == 32, "");
static_assert(offsetof(daf_indication, code) == kDafIndCodeOffset, "");
static_assert(offsetof(daf_indication, valid) == kDafIndValidOffset, "");
static_assert(offsetof(daf_indication, length) == kDafIndLengthOffset, "");
static_assert(offsetof(daf_indication, data) == kDafIndDataOffset, "");
