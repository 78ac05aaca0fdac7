// SPDX-License-Identifier: Apache-2.0
#include "request_pattern.h"

#include <stddef.h>
#include <stdlib.h>
#include <string.h>

#include "byte_order.h"
#include "kestrel_log.h"
#include "sensor1_messages.h"
#include "service_link/connection.h"
#include "service_link/response_waiter.h"

bool begin_request(sensor1_request* req, const char* name, int32_t handle_arg, uint32_t service,
                   int32_t msg_id, uint16_t size, uint8_t txn_id, alloc_failure_text text) {
  req->name = name;
  req->handle = get_handle_for_sensor(handle_arg);
  req->header.service_number = service;
  req->header.msg_id = msg_id;
  req->header.msg_size = size;
  req->header.txn_id = txn_id;
  req->body = nullptr;
  sensor1_handle_s* lent = lend_handle(req->handle);
  const int r = sensor1_alloc_msg_buf(lent, size, &req->body);
  return_handle(lent);
  if (r != SENSOR1_SUCCESS || req->body == nullptr) {
    switch (text) {
      case alloc_failure_text::kBracketed:
        KLOGE("[%s]sensor1_alloc_msg_buf error - %d\n", name, r);
        break;
      case alloc_failure_text::kGetRaw:
        KLOGE("get_raw error get_raw_data returned %d\n", r);
        break;
      case alloc_failure_text::kPlain:
        KLOGE("%s sensor1_alloc_msg_buf error:%d\n", name, r);
        break;
    }
    req->body = nullptr;
    return false;
  }
  // Only the listed fields of a request are meaningful; the rest is sent as zeros.
  memset(req->body, 0, size);
  return true;
}

namespace {

// The write, and on failure the release of the body, on the request's handle while it is still
// the current one (else on the empty handle, as after a failed reopen).
int write_or_free(sensor1_request* req) {
  sensor1_handle_s* lent = lend_handle(req->handle);
  int r = sensor1_write(lent, &req->header, req->body);
  if (r == SENSOR1_EWOULDBLOCK) r = SENSOR1_SUCCESS;
  if (r != SENSOR1_SUCCESS) {
    sensor1_free_msg_buf(lent, req->body);
    req->body = nullptr;
  }
  return_handle(lent);
  return r;
}

}  // namespace

int write_request(sensor1_request* req) {
  return write_or_free(req);
}

bool write_request_or_close(sensor1_request* req) {
  const int r = write_or_free(req);
  if (r == SENSOR1_SUCCESS) return true;
  KLOGE("[%s]sensor1_write -error  %d\n", req->name, r);
  // The handle is emptied with the close, so the next request opens a new connection instead of
  // writing on a closed one.
  const int closed = close_and_forget_handle(req->handle);
  if (closed != 0) {
    KLOGE("sensor1_close returned %d\n", closed);
    exit(closed);
  }
  return false;
}

int32_t wait_for_answer(const char* name) {
  const int32_t r = wait_for_response();
  if (r == 0) KLOGE("%s: ERROR: No response for command", name);
  return r;
}

void abandon_request(sensor1_request* req) {
  sensor1_handle_s* lent = lend_handle(req->handle);
  sensor1_free_msg_buf(lent, req->body);
  return_handle(lent);
  req->body = nullptr;
}

void write_test_request(void* body, int32_t sensor_id, uint8_t option0, uint8_t option1,
                        uint8_t option2, uint8_t option3) {
  store_u8(body, offsetof(single_sensor_test_request, sensor_id), static_cast<uint8_t>(sensor_id));
  store_u8(body, offsetof(single_sensor_test_request, data_type), 0);
  const size_t options = offsetof(single_sensor_test_request, option);
  store_u8(body, options + 0, option0);
  store_u8(body, options + 1, option1);
  store_u8(body, options + 2, option2);
  store_u8(body, options + 3, option3);
}

void write_test_type(void* body, uint32_t test_type) {
  store_u32(body, offsetof(single_sensor_test_request, test_type), test_type);
}

uint8_t test_request_sensor_id(const void* body) {
  return load_u8(body, offsetof(single_sensor_test_request, sensor_id));
}

void write_daf_request_id(void* body, uint32_t daf_request_id) {
  store_u32(body, offsetof(daf_request, daf_request_id), daf_request_id);
  store_u8(body, offsetof(daf_request, flag), 1);
  store_u8(body, offsetof(daf_request, trailing_flag), 0);
}

uint8_t* daf_suid_field(void* body) {
  return static_cast<uint8_t*>(body) + offsetof(daf_request, suid);
}

void write_daf_suid(void* body, const uint8_t* suid) {
  memcpy(daf_suid_field(body), suid, sizeof(daf_request::suid));
}

void write_daf_data(void* body, const void* data, uint32_t length) {
  if (length > kDafDataMax) length = kDafDataMax;
  store_u32(body, offsetof(daf_request, data_length), length);
  memcpy(static_cast<uint8_t*>(body) + offsetof(daf_request, data), data, length);
}
