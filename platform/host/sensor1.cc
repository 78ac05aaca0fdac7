// Placeholder until the sensor1 stand-in lands.
#include "sensor1.h"

#include "host_env.h"

extern "C" {
int sensor1_init(void) { return host_environment().sensor1_init_result; }
int sensor1_open(sensor1_handle_s**, sensor1_notify_data_cb_t, intptr_t) { return 11; }
int sensor1_close(sensor1_handle_s*) { return -1; }
int sensor1_alloc_msg_buf(sensor1_handle_s*, uint16_t, void**) { return -1; }
int sensor1_free_msg_buf(sensor1_handle_s*, void*) { return -1; }
int sensor1_write(sensor1_handle_s*, sensor1_msg_header_s*, void*) { return -1; }
}

#include <stdlib.h>

#include "sensor1_host.h"

extern "C" {
void* sensor1_host_alloc_body(size_t size) { return calloc(1, size > 0 ? size : 1); }
long sensor1_host_outstanding_bodies(void) { return 0; }
}
