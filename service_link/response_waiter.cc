// SPDX-License-Identifier: Apache-2.0
#include "response_waiter.h"

#include <errno.h>
#include <sys/time.h>
#include <time.h>

#include "factory_state.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"

namespace {

// Usable from the first instruction; main initialises them again before any thread starts.
response_waiter register_read_waiter = {PTHREAD_MUTEX_INITIALIZER, PTHREAD_COND_INITIALIZER, 0};
response_waiter command_waiter = {PTHREAD_MUTEX_INITIALIZER, PTHREAD_COND_INITIALIZER, 0};

void init_waiter(response_waiter* w) {
  pthread_mutex_init(&w->mutex, nullptr);
  pthread_cond_init(&w->cond, nullptr);
  w->arrived = 0;
}

bool arrived(response_waiter* w) {
  pthread_mutex_lock(&w->mutex);
  const bool a = w->arrived != 0;
  pthread_mutex_unlock(&w->mutex);
  return a;
}

}  // namespace

void init_response_waiters() {
  init_waiter(&register_read_waiter);
  init_waiter(&command_waiter);
}

int32_t wait_for_response() {
  KLOGI("waiting for response IN - timeout=%d", kResponseTimeoutMs);
  int32_t result = 0;
  pthread_mutex_lock(&command_waiter.mutex);
  if (command_waiter.arrived != 0) {
    KLOGE("%s: cb has arrived without waiting", "wait_for_response");
    result = 1;
  } else {
    // The deadline is on the wall clock, as the condition's default attributes make the timed
    // wait measure it: 8 s from now (scaled on the host).
    struct timeval now;
    gettimeofday(&now, nullptr);
    const uint64_t total_us = static_cast<uint64_t>(now.tv_usec) +
                              platform_scaled_microseconds(uint64_t{kResponseTimeoutMs} * 1000);
    struct timespec deadline;
    deadline.tv_sec = now.tv_sec + static_cast<time_t>(total_us / 1000000);
    deadline.tv_nsec = static_cast<long>((total_us % 1000000) * 1000);
    for (;;) {
      const int rc = pthread_cond_timedwait(&command_waiter.cond, &command_waiter.mutex, &deadline);
      result = rc == 0 ? 1 : 0;
      if (rc != 0) KLOGE("%s: pthread_cond_timedwait() rc=%d", "wait_for_response", rc);
      if (rc == ETIMEDOUT || command_waiter.arrived != 0) break;
    }
  }
  command_waiter.arrived = 0;
  pthread_mutex_unlock(&command_waiter.mutex);
  KLOGI("%s: response received.", "wait_for_response");
  return result;
}

void rcv_complete(int32_t status) {
  KLOGI("%s: result - %d\n", "rcv_complete", status);
  pthread_mutex_lock(&command_waiter.mutex);
  set_test_status(status);
  command_waiter.arrived = 1;
  pthread_cond_signal(&command_waiter.cond);
  pthread_mutex_unlock(&command_waiter.mutex);
}

void signal_response() {
  pthread_mutex_lock(&register_read_waiter.mutex);
  pthread_cond_signal(&register_read_waiter.cond);
  register_read_waiter.arrived = 1;
  pthread_mutex_unlock(&register_read_waiter.mutex);
}

bool command_waiter_arrived_for_testing() {
  return arrived(&command_waiter);
}

bool register_read_waiter_arrived_for_testing() {
  return arrived(&register_read_waiter);
}

void reset_response_waiters_for_testing() {
  pthread_mutex_lock(&command_waiter.mutex);
  command_waiter.arrived = 0;
  pthread_mutex_unlock(&command_waiter.mutex);
  pthread_mutex_lock(&register_read_waiter.mutex);
  register_read_waiter.arrived = 0;
  pthread_mutex_unlock(&register_read_waiter.mutex);
}
