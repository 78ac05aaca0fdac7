// Host-only additions of the sensor1 stand-in, for tests. The daemon never includes this file.
#pragma once

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

// Allocates a message body the way the library allocates those it gives to the callback, so a
// test can hand one to rcv_test_msg directly; the callback frees it with sensor1_free_msg_buf.
void* sensor1_host_alloc_body(size_t size);

// Bodies allocated by the library (sensor1_alloc_msg_buf, received messages, the function above)
// and not yet released, over the whole process.
long sensor1_host_outstanding_bodies(void);

#ifdef __cplusplus
}
#endif
