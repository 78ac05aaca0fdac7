// SPDX-License-Identifier: Apache-2.0
// The rendezvous by which a request on the main thread waits, at most 8 s, until the service
// callback on the library's thread reports that the awaited result has arrived.
#pragma once

#include <pthread.h>
#include <stdint.h>

struct response_waiter {
  pthread_mutex_t mutex;
  pthread_cond_t cond;
  uint8_t arrived;
};

constexpr int kResponseTimeoutMs = 8000;

// Initialises register_read_waiter, then command_waiter (default attributes, arrived 0).
void init_response_waiters();

// Blocks until command_waiter is raised or the deadline passes. 1 when a result was handed over.
int32_t wait_for_response();

// Raises command_waiter with status as test_status. Called at the end of every test indication.
void rcv_complete(int32_t status);

// Raises register_read_waiter.
void signal_response();

// For tests: whether a hand-over is pending on each waiter.
bool command_waiter_arrived_for_testing();
bool register_read_waiter_arrived_for_testing();
void reset_response_waiters_for_testing();
