// Host-only additions of the sensor1 stand-in, for tests. The daemon never includes this file.
//
// Results of the host library, beside 0 (success) and 11 (EWOULDBLOCK, the service is not up):
//   22 (EINVAL)  a null or closed handle, a null header, a null output pointer, or a null body
//                with a non-zero message size;
//   32 (EPIPE)   the service ended the connection (after the broken-pipe callback), or a record
//                could not be sent;
//   anything a FAULT record of kestrel-sim asks for.
#pragma once

#include <stddef.h>

#ifdef __cplusplus
extern "C" {
#endif

#define SENSOR1_HOST_EINVAL 22
#define SENSOR1_HOST_EPIPE 32

// Allocates a message body the way the library allocates those it gives to the callback, so a
// test can hand one to rcv_test_msg directly; the callback frees it with sensor1_free_msg_buf.
void* sensor1_host_alloc_body(size_t size);

// Bodies allocated by the library (sensor1_alloc_msg_buf, received messages, the function above)
// and not yet released, over the whole process.
long sensor1_host_outstanding_bodies(void);

#ifdef __cplusplus
}
#endif
