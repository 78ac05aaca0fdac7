// rcv_test_msg: the one callback the sensor1 library calls, on its own thread, for every
// response, indication and link event of the daemon's connection.
#pragma once

#include <stdint.h>

#include "sensor1.h"

// Initialises indication_lock, then register_dump_lock (default attributes).
void init_callback_locks();

void rcv_test_msg(intptr_t cb_data, sensor1_msg_header_s* msg_hdr, int msg_type, void* msg);

// The smallest body each message may have before a field of its layout would be read past its
// end; 0 when the message reads nothing. Bodies shorter than this are refused with one line.
uint32_t required_body_size(int msg_type, const sensor1_msg_header_s& hdr, const void* body);
