// The sensor1 messages the daemon writes and reads: services, message ids, transaction ids,
// request body layouts and the offsets it reads in responses and indications.
#pragma once

#include <stddef.h>
#include <stdint.h>

// Services.
constexpr uint32_t kServiceSmgr = 0;             // the sensor manager
constexpr uint32_t kServiceRegisterRead = 13;    // never addressed by the daemon
constexpr uint32_t kServiceDaf = 44;             // driver access, one driver by its SUID

// Message ids.
constexpr int32_t kMsgSmgrReport = 2;            // report request / response
constexpr int32_t kMsgSmgrSample = 3;            // sample indication
constexpr int32_t kMsgSmgrStatus = 11;           // sensor status request
constexpr int32_t kMsgSmgrSingleSensorTest = 13; // test request / test indication
constexpr int32_t kMsgSmgrCalReset = 38;         // calibration reset
constexpr int32_t kMsgSmgrSensorState = 64;      // sensor-state table
constexpr int32_t kMsgDafRequest = 32;           // daf_request / daf_response
constexpr int32_t kMsgDafIndication = 33;        // daf_indication

// Callback message types.
constexpr int kMsgTypeResponse = 1;
constexpr int kMsgTypeIndication = 2;
constexpr int kMsgTypeBrokenPipe = 250;
constexpr int kMsgTypeRetryOpen = 251;

// Transaction ids.
constexpr uint8_t kTxnSensorState = 0;
constexpr uint8_t kTxnReport = 2;
constexpr uint8_t kTxnSingleSensorTest = 4;
constexpr uint8_t kTxnStatus = 6;
constexpr uint8_t kTxnMotor = 7;
constexpr uint8_t kTxnDaf = 123;
constexpr uint8_t kTxnThreshold = 167;
constexpr uint8_t kTxnHdThreshold = 168;
constexpr uint8_t kTxnRegisterDumpFirst = 169;   // 169 + sensor_type, 0 to 5
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
  uint8_t flag;           // always 1
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
