// SPDX-License-Identifier: Apache-2.0
// How every sensor1 request is allocated, written and abandoned on failure.
#pragma once

#include <stdint.h>

#include "sensor1.h"

// The allocation-failure messages, by operation.
enum class alloc_failure_text {
  kBracketed,  // "[%s]sensor1_alloc_msg_buf error - %d\n"
  kGetRaw,     // "get_raw error get_raw_data returned %d\n"
  kPlain,      // "%s sensor1_alloc_msg_buf error:%d\n"
};

// One request in flight: its handle, header and body.
struct sensor1_request {
  const char* name;  // the operation's name, for its log lines
  sensor1_handle_s* handle;
  sensor1_msg_header_s header;
  void* body;
};

// Steps 1 to 3: gets the handle for handle_arg, fills the header and allocates a zeroed body of
// size bytes. Logs the allocation failure in the operation's text and returns false.
bool begin_request(sensor1_request* req, const char* name, int32_t handle_arg, uint32_t service,
                   int32_t msg_id, uint16_t size, uint8_t txn_id, alloc_failure_text text);

// Writes with the closing variant on failure: logs "[%s]sensor1_write -error  %d\n", frees the
// body, closes the handle (ending the process when the close fails). True when sent (0 or 11).
bool write_request_or_close(sensor1_request* req);

// Writes; on failure frees the body and returns the write's result so the caller can log its own
// non-closing line and carry on. Returns 0 when sent (0 or 11).
int write_request(sensor1_request* req);

// Frees the body of a request that is given up before it is written.
void abandon_request(sensor1_request* req);

// Step 6 of the pattern: waits, and logs "%s: ERROR: No response for command" when nothing came.
int32_t wait_for_answer(const char* name);

// Body writers. Only the fields named are written; begin_request has zeroed the rest.

// single-sensor test request: SensorID (the low byte of the id, 0xFF for -1), DataType 0 and the
// four option bytes. TestType is written by the caller, where it has one.
void write_test_request(void* body, int32_t sensor_id, uint8_t option0, uint8_t option1,
                        uint8_t option2, uint8_t option3);
void write_test_type(void* body, uint32_t test_type);
// SensorID as written, for the "id = %u" lines.
uint8_t test_request_sensor_id(const void* body);

// daf_request: the request id and the two flag bytes (20 = 1, 284 = 0).
void write_daf_request_id(void* body, uint32_t daf_request_id);
void write_daf_suid(void* body, const uint8_t* suid);
uint8_t* daf_suid_field(void* body);
// The data length and the first length bytes of the data (at most 256).
void write_daf_data(void* body, const void* data, uint32_t length);
