// Placeholder until the service callback lands.
#include "service_callback.h"

#include <pthread.h>

void init_callback_locks() {}

void rcv_test_msg(intptr_t cb_data, sensor1_msg_header_s* msg_hdr, int, void* msg) {
  if (msg_hdr == nullptr) return;
  if (msg != nullptr) {
    sensor1_free_msg_buf(*reinterpret_cast<sensor1_handle_s**>(cb_data), msg);
  }
}

uint32_t required_body_size(int, const sensor1_msg_header_s&, const void*) { return 0; }
