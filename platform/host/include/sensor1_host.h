// SPDX-License-Identifier: Apache-2.0
// Host-only additions of the sensor1 stand-in, for tests, fuzzers and kestrel-sim. The daemon never
// includes this file.
//
// Results of the host library, beside 0 (success) and 11 (EWOULDBLOCK, the service is not up):
//   22 (EINVAL)  a null or closed handle (a closed one is counted, see below), a null header, a
//   null output pointer, or a null body
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

// Calls made with a handle that is not empty and not an open connection's (closed, or of a
// connection gone since), over the whole process: alloc, write, close and free. Each is also
// logged at error as "<call> on a closed handle <handle>". On a phone such a handle may point at
// freed memory, so the daemon must make none.
long sensor1_host_stale_handle_calls(void);

#ifdef __cplusplus
}
#endif

#ifdef __cplusplus
#include <stdint.h>

namespace sensor1_host {

// One in-process connection, as its far end sees it.
class Link {
 public:
  // Hands one record (length first) to the library. It reaches the callback before the library
  // call in progress on this thread returns, or at once on the calling thread when none is; while
  // another thread is inside a callback, that thread delivers it after its callback returns.
  // False once the connection has ended.
  virtual bool send(const uint8_t* record, size_t size) = 0;
  // Ends the connection from the far side: the callback gets its broken pipe, once.
  virtual void drop() = 0;

 protected:
  ~Link() = default;
};

// The far end of in-process connections: the phone, in this process.
class Peer {
 public:
  // One record the library sends on link, on the thread of the library call that sends it (an
  // OPEN within sensor1_open, a WRITE within sensor1_write, a FAULT_ACK while a FAULT record is
  // delivered). link stays valid for the life of the process.
  virtual void receive(Link* link, const uint8_t* record, size_t size) = 0;
  // The library closed link (sensor1_close); nothing more comes on it.
  virtual void closed(Link* link) = 0;

 protected:
  ~Peer() = default;
};

// Where sensor1_open connects from now on: to peer, in this process and on the caller's thread,
// with no library thread; or, with null (the start), to the socket at KESTREL_SENSOR1_SOCKET.
// Connections already open keep their way.
void use_in_process_peer(Peer* peer);

}  // namespace sensor1_host
#endif
