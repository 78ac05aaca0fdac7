// SPDX-License-Identifier: Apache-2.0
// sensor1 client library: the interface the daemon uses to reach the sensor manager and the
// driver access service on the sensor processor. Same names and signatures as the phone's
// library; the host build implements it over a Unix socket to kestrel-sim.
#pragma once

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

typedef struct sensor1_handle_s sensor1_handle_s;

typedef struct sensor1_msg_header_s {
  uint32_t service_number;
  int32_t msg_id;
  uint16_t msg_size;
  uint8_t txn_id;
} sensor1_msg_header_s;

// Message types given to the callback.
#define SENSOR1_MSG_TYPE_RESP 1
#define SENSOR1_MSG_TYPE_IND 2
#define SENSOR1_MSG_TYPE_BROKEN_PIPE 250
#define SENSOR1_MSG_TYPE_RETRY_OPEN 251

// Results: 0 success, 11 EWOULDBLOCK, anything else an error.
#define SENSOR1_SUCCESS 0
#define SENSOR1_EWOULDBLOCK 11

typedef void (*sensor1_notify_data_cb_t)(intptr_t cb_data, sensor1_msg_header_s* msg_hdr,
                                         int msg_type, void* msg);

int sensor1_init(void);
int sensor1_open(sensor1_handle_s** handle, sensor1_notify_data_cb_t cb, intptr_t cb_data);
int sensor1_close(sensor1_handle_s* handle);
int sensor1_alloc_msg_buf(sensor1_handle_s* handle, uint16_t size, void** buf);
int sensor1_free_msg_buf(sensor1_handle_s* handle, void* buf);
int sensor1_write(sensor1_handle_s* handle, sensor1_msg_header_s* hdr, void* body);

#ifdef __cplusplus
}
#endif
