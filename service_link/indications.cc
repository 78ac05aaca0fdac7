// SPDX-License-Identifier: Apache-2.0
#include "indications.h"

#include <pthread.h>
#include <stdio.h>

#include <algorithm>

#include "byte_order.h"
#include "daemon/startup.h"
#include "diag/diag_logging.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kernel_sensors.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"
#include "sensor1_messages.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"
#include "service_link/sample_conversion.h"
#include "shell_command.h"

namespace {

pthread_mutex_t indication_lock = PTHREAD_MUTEX_INITIALIZER;

// The passed line shows 14 words, whatever the sensor.
constexpr size_t kPassedLineWords = 14;
// Failed magnetometer tests: the word that stands for the failed step is forced to -1.
constexpr int32_t kMagTestTypeFuseRom = 10;
constexpr int32_t kMagTestTypeSelfTest = 6;
constexpr size_t kMagFuseRomWord = 14;
// Data lengths a DAF indication must announce before its words are taken.
constexpr uint32_t kDafAlsRgbLength = 24;
constexpr uint32_t kDafShortLength = 8;
// The reopen after a broken link: three tries, a second apart.
constexpr int kReopenTries = 3;

constexpr size_t word_offset(size_t i) {
  return kTestIndWordsOffset + 4 * i;
}

// Result words a test indication carries for a sensor-manager id; 0 for the ids it stores
// nothing for.
size_t test_word_count(uint8_t sensor_id) {
  switch (sensor_id) {
    case kSmgrAccel:
      return 8;
    case kSmgrGyro:
      return 12;
    case kSmgrMag:
      return 16;
    case kSmgrPressure:
      return 2;
    default:
      return 0;
  }
}

enum class indication_kind { daf, test, sample, other };

indication_kind kind_of(const sensor1_msg_header_s& hdr) {
  if (hdr.service_number == kServiceDaf && hdr.msg_id == kMsgDafIndication) {
    return indication_kind::daf;
  }
  if (hdr.msg_id == kMsgSmgrSingleSensorTest) return indication_kind::test;
  if (hdr.msg_id == kMsgSmgrSample) return indication_kind::sample;
  return indication_kind::other;
}

// The result word and, on a failure, the error-code flag choose the path and test_status; the
// words stored for the sensor must all be there. The passed line shows 14 words and the failure
// line the error code: those are only logged.
body_need test_indication_size(const uint8_t* body, uint32_t size) {
  constexpr uint32_t kFixed = kTestIndResultOffset + 4;
  if (size < kFixed) return {kFixed, kFixed};
  const bool passed = load_u32(body, kTestIndResultOffset) == 0;
  uint32_t handled = passed ? kFixed : kTestIndErrorValidOffset + 1;
  const size_t words = test_word_count(load_u8(body, kTestIndSensorIdOffset));
  if (words > 0) handled = std::max<uint32_t>(handled, word_offset(words));
  if (size < handled) return {handled, handled};
  uint32_t logged = word_offset(kPassedLineWords);
  if (!passed) {
    logged = load_u8(body, kTestIndErrorValidOffset) == 1 ? kTestIndErrorCodeOffset + 1 : 0;
  }
  return {handled, std::max(handled, logged)};
}

// Codes 61 and 51 read their valid flag and length; only valid data of the full length reads its
// words. Other codes read nothing past the code.
uint32_t daf_indication_size(const uint8_t* body, uint32_t size) {
  constexpr uint32_t kFixed = kDafIndLengthOffset + 4;
  if (size < kDafIndCodeOffset + 1) return kDafIndCodeOffset + 1;
  const uint8_t code = load_u8(body, kDafIndCodeOffset);
  if (code != kDafIndAlsRgb && code != kDafIndShort) return kDafIndCodeOffset + 1;
  if (size < kFixed) return kFixed;
  const bool valid = load_u8(body, kDafIndValidOffset) != 0;
  const uint32_t length = load_u32(body, kDafIndLengthOffset);
  if (code == kDafIndAlsRgb) {
    return valid && length >= kDafAlsRgbLength ? kDafIndDataOffset + 6 * 4 : kFixed;
  }
  return valid && length >= kDafShortLength ? kDafIndDataOffset + 2 * 4 : kFixed;
}

template <size_t N>
void copy_words(const uint8_t* body, int32_t (&words)[N]) {
  for (size_t i = 0; i < N; ++i) words[i] = load_i32(body, word_offset(i));
}

// The passed line with the words the body holds (all 14 when it is whole).
void log_passed_line(const uint8_t* body, uint32_t size) {
  char line[256];
  int used =
      snprintf(line, sizeof line, "%s: Registers Received test Passed1: %i", "rcv_test_msg", 0);
  for (size_t i = 0; i < kPassedLineWords && word_offset(i + 1) <= size; ++i) {
    used += snprintf(line + used, sizeof line - static_cast<size_t>(used), ", %d",
                     load_i32(body, word_offset(i)));
  }
  KLOGI("%s", line);
}

void handle_test_indication(const uint8_t* body, uint32_t size) {
  const uint8_t sensor_id = load_u8(body, kTestIndSensorIdOffset);
  const int32_t test_type = load_i32(body, kTestIndTestTypeOffset);
  KLOGI("%s, SensorID:%d, TestType:%d", "rcv_test_msg", sensor_id, test_type);

  const bool passed = load_u32(body, kTestIndResultOffset) == 0;
  if (passed) {
    log_passed_line(body, size);
    set_test_status(0);
  } else if (load_u8(body, kTestIndErrorValidOffset) == 1) {
    if (size > kTestIndErrorCodeOffset) {
      KLOGE("%s: Received error in IND message: %i", "rcv_test_msg",
            load_u8(body, kTestIndErrorCodeOffset));
    }
    set_test_status(1);
  } else {
    // The requester set -1 before sending; a failure without a code leaves it there.
    KLOGE("%s: Message indicates error w/o code (%i)", "rcv_test_msg", test_status());
  }

  switch (sensor_id) {
    case kSmgrAccel: {
      int32_t words[8];
      copy_words(body, words);
      store_accel_result(words);
      break;
    }
    case kSmgrGyro: {
      int32_t words[12];
      copy_words(body, words);
      store_gyro_result(words);
      break;
    }
    case kSmgrMag: {
      int32_t words[16];
      copy_words(body, words);
      if (!passed && test_type == kMagTestTypeFuseRom) words[kMagFuseRomWord] = -1;
      if (!passed && test_type == kMagTestTypeSelfTest) words[0] = -1;
      store_mag_result(words);
      break;
    }
    case kSmgrPressure: {
      int32_t words[2];
      copy_words(body, words);
      store_pressure_result(words);
      break;
    }
    default:
      KLOGE("%s: wrong SensorID %u", "rcv_test_msg", static_cast<unsigned>(sensor_id));
      break;
  }
  // Every test indication raises the waiter, stored or not: the requester learns the outcome
  // from test_status.
  rcv_complete(test_status());
}

void send_sample_frame(const sample_frame& frame) {
  send_to_kernel(FRAME_SAMPLE, &frame, sizeof frame);
}

void handle_sample_indication(const uint8_t* body) {
  pthread_mutex_lock(&indication_lock);
  sample_frame frame;
  convert_sample(load_u8(body, kSampleSensorIdOffset), load_u8(body, kSampleDataTypeOffset),
                 load_i32(body, kSampleXOffset), load_i32(body, kSampleYOffset),
                 load_i32(body, kSampleZOffset), mag_sensitivity(), &frame);
  send_sample_frame(frame);
  pthread_mutex_unlock(&indication_lock);
}

int16_t daf_value(const uint8_t* body, size_t word) {
  return static_cast<int16_t>(
      static_cast<uint16_t>(load_u32(body, kDafIndDataOffset + 4 * word) & 0xffff));
}

void handle_daf_indication(const uint8_t* body) {
  pthread_mutex_lock(&indication_lock);
  // A frame goes out whatever the indication held; when nothing was filled it is all zeros.
  sample_frame frame = {};
  const uint8_t code = load_u8(body, kDafIndCodeOffset);
  if (code == kDafIndAlsRgb) {
    const uint8_t valid = load_u8(body, kDafIndValidOffset);
    const uint32_t length = load_u32(body, kDafIndLengthOffset);
    if (valid != 0 && length >= kDafAlsRgbLength) {
      frame.code = SENSOR_CODE_RAW;
      frame.value[0] = daf_value(body, 1);
      frame.value[1] = daf_value(body, 2);
      frame.value[2] = daf_value(body, 3);
      frame.value[3] = daf_value(body, 0);
      frame.value[4] = daf_value(body, 4);
      frame.value[5] = daf_value(body, 5);
    } else {
      KLOGE(
          "[DAF]daf_test: Unexpected error when parsing DAF ALS & RGB Polling IndicationMsg! "
          "valid %d len %d\n",
          valid, static_cast<int>(length));
    }
  } else if (code == kDafIndShort) {
    if (load_u8(body, kDafIndValidOffset) != 0 &&
        load_u32(body, kDafIndLengthOffset) >= kDafShortLength) {
      frame.code = SENSOR_CODE_LIGHT;
      frame.value[0] = daf_value(body, 0);
      frame.value[1] = daf_value(body, 1);
    } else {
      KLOGE("[DAF]msgPtr->IndicationMsg_valid false");
    }
  }
  send_sample_frame(frame);
  pthread_mutex_unlock(&indication_lock);
}

// The debug-level decision of boot, made again once the link is back.
void restart_diag_logging() {
  if (check_loglevel()) {
    set_diag_logging_state(diag_state::stopped);
  } else {
    sns_set_diag_tx_mode();
  }
}

}  // namespace

void init_indication_lock() {
  pthread_mutex_init(&indication_lock, nullptr);
}

body_need required_indication_size(const sensor1_msg_header_s& hdr, const uint8_t* body,
                                   uint32_t size) {
  switch (kind_of(hdr)) {
    case indication_kind::daf: {
      const uint32_t n = daf_indication_size(body, size);
      return {n, n};
    }
    case indication_kind::test:
      return test_indication_size(body, size);
    case indication_kind::sample:
      // The three words are read whatever the sensor id, before the conversion picks its row.
      return {kSampleZOffset + 4, kSampleZOffset + 4};
    case indication_kind::other:
      break;
  }
  return {0, 0};
}

void handle_indication(const sensor1_msg_header_s& hdr, const uint8_t* body, uint32_t size) {
  switch (kind_of(hdr)) {
    case indication_kind::daf:
      handle_daf_indication(body);
      break;
    case indication_kind::test:
      handle_test_indication(body, size);
      break;
    case indication_kind::sample:
      handle_sample_indication(body);
      break;
    case indication_kind::other:
      break;
  }
}

void handle_broken_pipe() {
  begin_link_recovery();
  KLOGE("BROKEN_PIPE sensor1_handle %p\n", static_cast<void*>(current_sensor1_handle()));
  if (diag_logging_state() != diag_state::stopped) {
    set_diag_logging_state(diag_state::stopped);
    run_shell_command(kDiagMdlogStop);
  }
  platform_sleep_milliseconds(50);
  close_sensor1_handle();

  sensor1_handle_s* handle = nullptr;
  for (int i = 0; i < kReopenTries && handle == nullptr; ++i) {
    platform_sleep_seconds(1);
    handle = get_handle_for_sensor(0);
  }
  if (handle != nullptr) {
    KLOGE("BROKEN_PIPE success to open sensor1\n");
    platform_sleep_seconds(2);
    restart_diag_logging();
  } else {
    KLOGE("BROKEN_PIPE fail to open sensor1\n");
  }
  end_link_recovery();

  KLOGI("%s read/update light coef efs file in broken pipe\n", "rcv_test_msg");
  pthread_t thread;
  if (pthread_create(&thread, nullptr, hh_read_data_thread, nullptr) != 0) {
    KLOGE("%s hh_read_data_thread init err\n", "rcv_test_msg");
  } else {
    KLOGI("%s hh_read_data_thread success\n", "rcv_test_msg");
    // Never joined: the thread ends by itself after its one frame.
    pthread_detach(thread);
  }
}

void handle_retry_open() {
  KLOGE("\n received RETRY_OPEN!!!\n");
}
