// SPDX-License-Identifier: Apache-2.0
// rcv_test_msg: the one callback the sensor1 library calls, on its own thread, for every
// response, indication and link event of the daemon's connection.
#pragma once

#include <stdint.h>

#include "sensor1.h"

// Initialises indication_lock, then register_dump_lock (default attributes).
void init_callback_locks();

void rcv_test_msg(intptr_t cb_data, sensor1_msg_header_s* msg_hdr, int msg_type, void* msg);

// Bytes of body a message needs: for what it stores, relays or chooses its path by, and for
// everything its log lines show. A body shorter than the first is refused with one line; one
// shorter than the second is handled, its lines show what is there, and one line says so.
struct body_need {
  uint32_t handled;
  uint32_t logged;
};

// 0 and 0 when the message reads nothing.
body_need required_body_size(int msg_type, const sensor1_msg_header_s& hdr, const void* body);
