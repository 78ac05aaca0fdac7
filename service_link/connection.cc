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
// one of them at a time runs the open loop. The lock guards only the flags below and the
// check-and-claim of the open: it is never held across a sensor1 call, because the library may
// make sensor1_close wait for the callback thread, and the callback thread takes this lock.
pthread_mutex_t g_open_lock = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t g_open_done = PTHREAD_COND_INITIALIZER;  // with g_open_lock
bool g_opening = false;                                 // a thread runs the open loop
// The link broke while a connection was being opened: the one being opened is the broken one,
// and its opener closes it instead of keeping it.
bool g_broken_while_opening = false;

// The open-with-budget loop. Only the thread that claimed the open runs it.
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

// Returns the current handle, opening it first when it is empty and the budget allows. An open
// in progress on another thread is waited for when wait is set; otherwise the (empty) handle is
// returned at once.
sensor1_handle_s* open_handle(int32_t sensor_type, bool wait) {
  pthread_mutex_lock(&g_open_lock);
  while (wait && g_opening) pthread_cond_wait(&g_open_done, &g_open_lock);
  const bool claim =
      !g_opening && g_open_retry_budget.load() >= 1 && sensor1_handle.load() == nullptr;
  if (claim) {
    g_opening = true;
    g_broken_while_opening = false;
  }
  pthread_mutex_unlock(&g_open_lock);
  if (!claim) return sensor1_handle.load();

  sensor1_open_or_reopen(sensor_type);

  pthread_mutex_lock(&g_open_lock);
  g_opening = false;
  sensor1_handle_s* broken = g_broken_while_opening ? sensor1_handle.exchange(nullptr) : nullptr;
  g_broken_while_opening = false;
  pthread_cond_broadcast(&g_open_done);
  pthread_mutex_unlock(&g_open_lock);
  if (broken != nullptr) sensor1_close(broken);
  return sensor1_handle.load();
}

}  // namespace

sensor1_handle_s* get_handle_for_sensor(int32_t sensor_type) {
  return open_handle(sensor_type, true);
}

sensor1_handle_s* get_handle_without_waiting(int32_t sensor_type) {
  return open_handle(sensor_type, false);
}

sensor1_handle_s* current_sensor1_handle() {
  return sensor1_handle.load();
}

intptr_t sensor1_callback_data() {
  return reinterpret_cast<intptr_t>(&sensor1_handle);
}

int close_sensor1_handle() {
  pthread_mutex_lock(&g_open_lock);
  if (g_opening) g_broken_while_opening = true;
  sensor1_handle_s* handle = sensor1_handle.exchange(nullptr);
  pthread_mutex_unlock(&g_open_lock);
  return handle != nullptr ? sensor1_close(handle) : 0;
}

int close_and_forget_handle(sensor1_handle_s* handle) {
  pthread_mutex_lock(&g_open_lock);
  sensor1_handle_s* expected = handle;
  const bool current =
      handle != nullptr && sensor1_handle.compare_exchange_strong(expected, nullptr);
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
  pthread_mutex_unlock(&g_open_lock);
  g_open_retry_budget.store(kOpenRetryBudget);
}
