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
// this lock makes the check-and-open one step so two of them never open at once.
pthread_mutex_t g_open_lock = PTHREAD_MUTEX_INITIALIZER;

// The open-with-budget loop. Called with g_open_lock held.
void sensor1_open_or_reopen(int32_t sensor_type) {
  for (;;) {
    sensor1_handle_s* opened = nullptr;
    const int r = sensor1_open(&opened, rcv_test_msg, reinterpret_cast<intptr_t>(&sensor1_handle));
    if (r == SENSOR1_SUCCESS) {
      sensor1_handle.store(opened);
      KLOGI("%s: sensor1_open success\n", "sensor1_open_or_reopen");
      KLOGI("%s: id:%d\n", "get_handle_for_sensor", sensor_type);
      g_open_retry_budget.store(kOpenRetryBudget);
      return;
    }
    const int32_t before = g_open_retry_budget.load();
    if (r == SENSOR1_EWOULDBLOCK) {
      KLOGE("%s: sensor1_open returned EWOULDBLOCK.Daemon not ready, will try again (retry = %d)",
            "sensor1_open_or_reopen", before);
    } else {
      KLOGE("%s: sensor1_open() failed ret=%d", "sensor1_open_or_reopen", r);
    }
    g_open_retry_budget.store(before - 1);
    if (before <= 1) return;
  }
}

}  // namespace

sensor1_handle_s* get_handle_for_sensor(int32_t sensor_type) {
  pthread_mutex_lock(&g_open_lock);
  if (g_open_retry_budget.load() >= 1 && sensor1_handle.load() == nullptr) {
    sensor1_open_or_reopen(sensor_type);
  }
  sensor1_handle_s* handle = sensor1_handle.load();
  pthread_mutex_unlock(&g_open_lock);
  return handle;
}

sensor1_handle_s* current_sensor1_handle() { return sensor1_handle.load(); }

intptr_t sensor1_callback_data() { return reinterpret_cast<intptr_t>(&sensor1_handle); }

int close_sensor1_handle() {
  pthread_mutex_lock(&g_open_lock);
  sensor1_handle_s* handle = sensor1_handle.exchange(nullptr);
  const int r = handle != nullptr ? sensor1_close(handle) : 0;
  pthread_mutex_unlock(&g_open_lock);
  return r;
}

int close_and_forget_handle(sensor1_handle_s* handle) {
  pthread_mutex_lock(&g_open_lock);
  sensor1_handle_s* expected = handle;
  const bool current = handle != nullptr && sensor1_handle.compare_exchange_strong(expected, nullptr);
  const int r = current ? sensor1_close(handle) : 0;
  pthread_mutex_unlock(&g_open_lock);
  return r;
}

int32_t open_retry_budget() { return g_open_retry_budget.load(); }

void reset_connection_for_testing() {
  close_sensor1_handle();
  g_open_retry_budget.store(kOpenRetryBudget);
}
