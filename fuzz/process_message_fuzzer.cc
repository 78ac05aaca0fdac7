// SPDX-License-Identifier: Apache-2.0
// process_message on an arbitrary datagram of at most 1024 bytes, copied into a 1024-byte
// receive buffer as the receive loop does. Every handler runs against the in-process sensor1
// library reaching kestrel-sim's phone in process, which answers at once, the host registry (a
// calibrated phone's) and the host libdiag.
//
// A DIAG dump (command 27) starts diag_logging_thread; the input waits for it to end.
//
// The bytes of the receive buffer past the datagram are poisoned, so a handler that reads beyond
// what was received is reported even though the buffer itself is larger.
//
// The scenario. The daemon never reads nlmsg_seq (frame bytes 8 to 11); the fuzzer reads the
// first frame's as the state of the phone for this datagram, so the same walk also runs through
// the failure paths:
//   bits 0-1   DIAG logging state at the start: stopped, logging, dumping, stopped
//   bit 2      sensor1_alloc_msg_buf fails
//   bit 3      sensor1_write fails with 32 (the body stays with the daemon)
//   bit 4      sensor1_write returns 11 (the body is taken, nothing is answered)
//   bit 5      tests fail with an error code
//   bit 6      tests fail without an error code
//   bit 7      no indications at all (every wait times out, at once with the time scale 0)
//   bit 8      sensor1_open fails with 11 until the open budget is spent
//   bit 9      responses carry result 1
//   bits 10-12 block 1 to 4 of every outbound frame cannot be allocated (0 and 5 to 7: none)
// An all-zero word is a healthy phone with logging off.
#include <stddef.h>
#include <stdint.h>
#include <string.h>

#include "fuzz_support.h"
#include "kernel_channel/process_message.h"

#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#include <sanitizer/asan_interface.h>
#define KESTREL_POISON(p, n) ASAN_POISON_MEMORY_REGION(p, n)
#define KESTREL_UNPOISON(p, n) ASAN_UNPOISON_MEMORY_REGION(p, n)
#endif
#endif
#ifndef KESTREL_POISON
#define KESTREL_POISON(p, n) ((void)(p), (void)(n))
#define KESTREL_UNPOISON(p, n) ((void)(p), (void)(n))
#endif

namespace {

constexpr size_t kReceiveBufferSize = 1024;
constexpr size_t kSeqOffset = 8;

alignas(8) uint8_t g_buffer[kReceiveBufferSize];

uint32_t scenario_of(const uint8_t* data, size_t size) {
  if (size < kSeqOffset + 4) return 0;
  uint32_t v;
  memcpy(&v, data + kSeqOffset, sizeof v);
  return v;
}

void set_scenario(uint32_t s) {
  kestrel_fuzz::reset_daemon_state(kestrel_fuzz::diag_state_of_bits(s));
  kestrel_fuzz::phone_scenario b;
  b.alloc_result = (s & (1u << 2)) != 0 ? 12 : 0;
  if ((s & (1u << 3)) != 0) {
    b.write_result = 32;
  } else if ((s & (1u << 4)) != 0) {
    b.write_result = 11;
  }
  if ((s & (1u << 5)) != 0) {
    b.knobs.outcome = kestrel_sim::TestOutcome::kFailedWithCode;
  } else if ((s & (1u << 6)) != 0) {
    b.knobs.outcome = kestrel_sim::TestOutcome::kFailedWithoutCode;
  }
  b.knobs.no_indications = (s & (1u << 7)) != 0;
  b.open_fails = (s & (1u << 8)) != 0;
  b.knobs.failed_responses = (s & (1u << 9)) != 0;
  kestrel_fuzz::set_phone_scenario(b);
  const int block = static_cast<int>((s >> 10) & 7);
  kestrel_fuzz::fail_frame_block(block <= 4 ? block : 0);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  kestrel_fuzz::setup_fuzz_environment(kestrel_fuzz::kNormalProperties,
                                       kestrel_fuzz::kCalibratedRegistry);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kReceiveBufferSize) return -1;  // more than one receive can return
  set_scenario(scenario_of(data, size));

  // Not cleared between receives: the bytes past this datagram are an earlier one's, and nothing
  // may read them.
  KESTREL_UNPOISON(g_buffer, kReceiveBufferSize);
  if (size > 0) memcpy(g_buffer, data, size);
  KESTREL_POISON(g_buffer + size, kReceiveBufferSize - size);
  process_message(g_buffer, static_cast<int32_t>(size));
  KESTREL_UNPOISON(g_buffer, kReceiveBufferSize);

  // Every request body went to the library or back to the allocator, every body the library
  // gave the callback was released.
  kestrel_fuzz::wait_for_daemon_threads();
  kestrel_fuzz::check_bodies_released();
  return 0;
}
