// SPDX-License-Identifier: Apache-2.0
#include "connection.h"

#include <pthread.h>

#include <atomic>

#include "kestrel_log.h"
#include "service_callback.h"

namespace {

// The callback data registered with the connection is the address of this variable, so the
// callback always reaches the current handle.
std::atomic<sensor1_handle_s*> sensor1_handle{nullptr};

// Consecutive failed open attempts still allowed, over the whole life of the process.
std::atomic<int32_t> g_open_retry_budget{kOpenRetryBudget};

// The main thread, the DIAG start thread and the callback thread may all open the connection;
// one of them at a time runs the open loop, and the others wait for its result. The lock guards
// the fields below and every change of sensor1_handle. It is never held across a sensor1 call:
// the library may make sensor1_close wait for the callback thread, and that thread takes it.
pthread_mutex_t g_open_lock = PTHREAD_MUTEX_INITIALIZER;
// Broadcast when an open ends and when a lent handle comes back.
pthread_cond_t g_link_changed = PTHREAD_COND_INITIALIZER;
bool g_opening = false;  // a thread runs the open loop
// The library delivered a broken link, inside the open loop's own sensor1_open on the opener's
// thread: the connection being opened is the broken one, and its opener closes it once the open
// returns (its callback has returned by then).
bool g_broken_while_opening = false;
// The broken-pipe recovery runs on the callback thread; it closes the current handle itself.
bool g_recovering = false;
// sensor1 calls in progress on the current handle (lend_handle), over every thread.
int g_lent = 0;
// This thread's share of them: a callback that the library runs inside one of them, on the same
// thread, must not wait for it.
thread_local int t_lent = 0;
// This thread runs the open loop (a callback run inside its sensor1_open must not wait for it).
thread_local bool t_opening = false;

// The open-with-budget loop. Only the thread that claimed the open runs it; the handle is stored
// by the caller.
sensor1_handle_s* sensor1_open_or_reopen(int32_t sensor_type) {
  for (;;) {
    sensor1_handle_s* opened = nullptr;
    const int r = sensor1_open(&opened, rcv_test_msg, reinterpret_cast<intptr_t>(&sensor1_handle));
    if (r == SENSOR1_SUCCESS) {
      KLOGI("%s: sensor1_open success\n", "sensor1_open_or_reopen");
      KLOGI("%s: id:%d\n", "get_handle_for_sensor", sensor_type);
      g_open_retry_budget.store(kOpenRetryBudget);
      return opened;
    }
    const int32_t before = g_open_retry_budget.load();
    if (r == SENSOR1_EWOULDBLOCK) {
      KLOGE("%s: sensor1_open returned EWOULDBLOCK.Daemon not ready, will try again (retry = %d)",
            "sensor1_open_or_reopen", before);
    } else {
      KLOGE("%s: sensor1_open() failed ret=%d", "sensor1_open_or_reopen", r);
    }
    g_open_retry_budget.store(before - 1);
    if (before <= 1) return nullptr;
  }
}

// Waits, with g_open_lock held, until no other thread runs the open loop. The open loop ends by
// itself (each attempt is bounded by the library, and the budget by 50), and no opener waits for
// the thread that waits here.
void wait_for_open_elsewhere() {
  while (g_opening && !t_opening) pthread_cond_wait(&g_link_changed, &g_open_lock);
}

// Empties sensor1_handle and waits until the calls of other threads on it have returned; with
// g_open_lock held. The caller closes the result (if not null) after unlocking.
sensor1_handle_s* take_handle_for_close() {
  sensor1_handle_s* handle = sensor1_handle.exchange(nullptr);
  while (g_lent > t_lent) pthread_cond_wait(&g_link_changed, &g_open_lock);
  return handle;
}

}  // namespace

sensor1_handle_s* get_handle_for_sensor(int32_t sensor_type) {
  pthread_mutex_lock(&g_open_lock);
  wait_for_open_elsewhere();
  const bool claim =
      !g_opening && g_open_retry_budget.load() >= 1 && sensor1_handle.load() == nullptr;
  if (claim) {
    g_opening = true;
    t_opening = true;
    g_broken_while_opening = false;
  }
  pthread_mutex_unlock(&g_open_lock);
  if (!claim) return sensor1_handle.load();

  sensor1_handle_s* opened = sensor1_open_or_reopen(sensor_type);

  pthread_mutex_lock(&g_open_lock);
  g_opening = false;
  t_opening = false;
  sensor1_handle_s* broken = g_broken_while_opening ? opened : nullptr;
  g_broken_while_opening = false;
  sensor1_handle.store(broken != nullptr ? nullptr : opened);
  pthread_cond_broadcast(&g_link_changed);
  pthread_mutex_unlock(&g_open_lock);
  if (broken != nullptr) sensor1_close(broken);
  return sensor1_handle.load();
}

sensor1_handle_s* current_sensor1_handle() {
  return sensor1_handle.load();
}

intptr_t sensor1_callback_data() {
  return reinterpret_cast<intptr_t>(&sensor1_handle);
}

sensor1_handle_s* lend_handle(sensor1_handle_s* handle) {
  pthread_mutex_lock(&g_open_lock);
  const bool current = handle != nullptr && handle == sensor1_handle.load();
  if (current) {
    ++g_lent;
    ++t_lent;
  }
  pthread_mutex_unlock(&g_open_lock);
  return current ? handle : nullptr;
}

void return_handle(sensor1_handle_s* lent) {
  if (lent == nullptr) return;
  pthread_mutex_lock(&g_open_lock);
  --g_lent;
  --t_lent;
  pthread_cond_broadcast(&g_link_changed);
  pthread_mutex_unlock(&g_open_lock);
}

void begin_link_recovery() {
  pthread_mutex_lock(&g_open_lock);
  g_recovering = true;
  pthread_mutex_unlock(&g_open_lock);
}

void end_link_recovery() {
  pthread_mutex_lock(&g_open_lock);
  g_recovering = false;
  pthread_mutex_unlock(&g_open_lock);
}

int close_sensor1_handle() {
  pthread_mutex_lock(&g_open_lock);
  wait_for_open_elsewhere();
  if (g_opening) g_broken_while_opening = true;  // this thread's own open, further out
  sensor1_handle_s* handle = take_handle_for_close();
  pthread_mutex_unlock(&g_open_lock);
  return handle != nullptr ? sensor1_close(handle) : 0;
}

int close_and_forget_handle(sensor1_handle_s* handle) {
  pthread_mutex_lock(&g_open_lock);
  const bool current = handle != nullptr && handle == sensor1_handle.load() && !g_recovering;
  if (current) take_handle_for_close();
  pthread_mutex_unlock(&g_open_lock);
  return current ? sensor1_close(handle) : 0;
}

int32_t open_retry_budget() {
  return g_open_retry_budget.load();
}

void reset_connection_for_testing() {
  close_sensor1_handle();
  pthread_mutex_lock(&g_open_lock);
  g_broken_while_opening = false;
  g_recovering = false;
  pthread_mutex_unlock(&g_open_lock);
  g_open_retry_budget.store(kOpenRetryBudget);
}
