// SPDX-License-Identifier: Apache-2.0
// The bodies the sensor service sends, built through the records the daemon reads them by: the
// indications, the common response and the responses that carry data. Shared by the phone model,
// the tests and the fuzz seeds.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <string.h>

#include <algorithm>
#include <array>
#include <vector>

#include "sensor1_messages.h"

namespace kestrel_sim {

// A record as the bytes of a body.
template <typename Record>
std::vector<uint8_t> body_of(const Record& record) {
  std::vector<uint8_t> body(sizeof record);
  memcpy(body.data(), &record, sizeof record);
  return body;
}

// A record whose every byte is zero, whatever member of a union is used later.
template <typename Record>
Record zeroed() {
  Record record;
  memset(&record, 0, sizeof record);
  return record;
}

// A body read into a record; the bytes past the body's end read as zero.
template <typename Record>
Record record_of(const std::vector<uint8_t>& body) {
  Record record = zeroed<Record>();
  memcpy(&record, body.data(), std::min(body.size(), sizeof record));
  return record;
}

// A single-sensor test indication (84 bytes): at most 16 result words.
std::vector<uint8_t> test_indication_body(uint8_t sensor_id, int32_t test_type, uint32_t result,
                                          uint8_t error_valid, uint8_t error_code,
                                          const std::vector<int32_t>& words);
// A sample indication (24 bytes).
std::vector<uint8_t> sample_indication_body(uint8_t sensor_id, uint8_t data_type, int32_t x,
                                            int32_t y, int32_t z);
// A daf_indication (32 bytes).
std::vector<uint8_t> daf_indication_body(uint8_t code, uint8_t valid, uint32_t length,
                                         const std::array<int32_t, 6>& data);
// A response of the common form: result, error, then zeros up to size bytes.
std::vector<uint8_t> common_response_body(uint8_t result, uint8_t error, size_t size = 2);

// The sensor-state table of the phone: its six sensors online and powered, the rest empty.
std::vector<uint8_t> sensor_state_body(const common_response& common);
// A report response naming the report's sensor.
std::vector<uint8_t> report_response_body(const common_response& common, uint8_t sensor_id);
// A daf_response carrying threshold words.
std::vector<uint8_t> daf_thresholds_body(const common_response& common,
                                         const daf_thresholds& thresholds);
// A daf_response carrying the register dump that a register-dump txn_id names (169 + index).
std::vector<uint8_t> register_dump_body(const common_response& common, uint8_t txn_id);

}  // namespace kestrel_sim
