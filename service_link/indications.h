// SPDX-License-Identifier: Apache-2.0
// The indication and link-event branches of rcv_test_msg: test results into the factory store,
// samples and light-sensor polling data out to the kernel, and the recovery of a broken link.
// Everything here runs on the sensor1 library's thread.
#pragma once

#include <stdint.h>

#include "sensor1.h"
#include "service_link/service_callback.h"

// indication_lock: held while a sample_frame is filled and sent, so frames of type 2 from the
// sample and the DAF indications never interleave. Statically initialised; main initialises it
// again (default attributes) before any thread starts.
void init_indication_lock();

// Bytes of body an indication needs on the path its own fields choose: the test indication up to
// its last stored word to be handled and up to the last word of its passed line to be logged
// whole, 24 for a sample, 32 / 16 for the filled DAF codes 61 / 51, 0 for the ids nothing is read
// from. size is how many bytes of body exist; a field that chooses the path and lies beyond them
// makes its own end the answer.
body_need required_indication_size(const sensor1_msg_header_s& hdr, const uint8_t* body,
                                   uint32_t size);

// Message type 2. body holds size bytes, at least the handled bytes of required_indication_size;
// nothing past them is read.
void handle_indication(const sensor1_msg_header_s& hdr, const uint8_t* body, uint32_t size);

// Message type 250: tears the connection down and rebuilds it, restarts DIAG logging where the
// debug level allows it and starts a new hh_read_data_thread. Blocks the caller at least 3 s.
void handle_broken_pipe();

// Message type 251: logged only.
void handle_retry_open();
