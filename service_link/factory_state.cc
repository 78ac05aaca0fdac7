// SPDX-License-Identifier: Apache-2.0
#include "factory_state.h"

#include <pthread.h>
#include <string.h>

#include <atomic>

namespace {

// A leaf lock: held only inside the functions of this file, never while another is taken.
pthread_mutex_t g_store_lock = PTHREAD_MUTEX_INITIALIZER;
factory_results g_results = {};

// Read by the callback for every magnetometer sample, written on the main thread.
std::atomic<float> g_sensitivity_x{0.0f};
std::atomic<float> g_sensitivity_y{0.0f};
std::atomic<float> g_sensitivity_z{0.0f};

template <size_t N>
void store_words(int32_t (&field)[N], const int32_t (&words)[N]) {
  pthread_mutex_lock(&g_store_lock);
  memcpy(field, words, sizeof field);
  pthread_mutex_unlock(&g_store_lock);
}

}  // namespace

factory_results factory_state() {
  pthread_mutex_lock(&g_store_lock);
  factory_results copy = g_results;
  pthread_mutex_unlock(&g_store_lock);
  return copy;
}

void set_test_status(int32_t status) {
  pthread_mutex_lock(&g_store_lock);
  g_results.test_status = status;
  pthread_mutex_unlock(&g_store_lock);
}

int32_t test_status() {
  pthread_mutex_lock(&g_store_lock);
  const int32_t status = g_results.test_status;
  pthread_mutex_unlock(&g_store_lock);
  return status;
}

void store_accel_result(const int32_t (&words)[8]) {
  store_words(g_results.accel_result, words);
}
void store_gyro_result(const int32_t (&words)[12]) {
  store_words(g_results.gyro_result, words);
}
void store_mag_result(const int32_t (&words)[16]) {
  store_words(g_results.mag_result, words);
}
void store_pressure_result(const int32_t (&words)[2]) {
  store_words(g_results.pressure_result, words);
}

mag_sensitivity_values mag_sensitivity() {
  return {g_sensitivity_x.load(std::memory_order_relaxed),
          g_sensitivity_y.load(std::memory_order_relaxed),
          g_sensitivity_z.load(std::memory_order_relaxed)};
}

void set_mag_sensitivity(float x, float y, float z) {
  g_sensitivity_x.store(x, std::memory_order_relaxed);
  g_sensitivity_y.store(y, std::memory_order_relaxed);
  g_sensitivity_z.store(z, std::memory_order_relaxed);
}

void reset_factory_state_for_testing() {
  pthread_mutex_lock(&g_store_lock);
  g_results = factory_results{};
  pthread_mutex_unlock(&g_store_lock);
  set_mag_sensitivity(0.0f, 0.0f, 0.0f);
}
