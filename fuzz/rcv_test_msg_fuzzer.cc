// SPDX-License-Identifier: Apache-2.0
// rcv_test_msg, the service callback, on an arbitrary message: any message type, a header or
// none, a body or none, of any size (shorter than every layout included). The body comes from the
// sensor1 library's allocator with exactly its size, and msg_size is that size.
//
// Input layout, little-endian (missing bytes read as 0):
//   0   i32  message type (1 response, 2 indication, 250 broken pipe, 251 retry open, any other)
//   4   u8   bit 0: a header is given; bit 1: a body is given
//   5   u8   the process state before the call:
//              bit 0     the connection is open
//              bits 1-2  DIAG logging state stopped, logging, dumping, stopped
//              bit 3     magnetometer sensitivities 1.0 (else 0, as at start)
//              bit 4     a reopen fails (sensor1_open returns 11)
//              bit 5     "ro.debug_level" forbids logging
//   6   u32  service_number
//   10  i32  msg_id
//   14  u8   txn_id
//   15  ...  body
// A broken pipe tears the connection down and reopens it at once (time scale 0); the
// hh_read_data_thread it starts sends its frame and ends by itself, and the input waits for it.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <string>

#include "fuzz_support.h"
#include "sensor1.h"
#include "sensor1_host.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "service_link/service_callback.h"

namespace {

constexpr size_t kFieldsSize = 15;
constexpr size_t kMaxBody = 65535;

const kestrel_fuzz::fuzz_paths* g_paths = nullptr;
bool g_logging_forbidden = false;

const char kForbiddingProperties[] =
    "persist.sys.usb.q_config=mtp,adb\n"
    "ro.debug_level=0x4f4c\n";

void set_properties(bool forbid) {
  if (forbid == g_logging_forbidden) return;
  const std::string text = forbid ? kForbiddingProperties : kestrel_fuzz::kNormalProperties;
  kestrel_fuzz::write_file(g_paths->properties, text.data(), text.size());
  g_logging_forbidden = forbid;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  g_paths = &kestrel_fuzz::setup_fuzz_environment(kestrel_fuzz::kNormalProperties,
                                                  kestrel_fuzz::kCalibratedRegistry);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  uint8_t fields[kFieldsSize] = {};
  memcpy(fields, data, size < kFieldsSize ? size : kFieldsSize);
  const uint8_t* body_bytes = data + (size < kFieldsSize ? size : kFieldsSize);
  size_t body_size = size > kFieldsSize ? size - kFieldsSize : 0;
  if (body_size > kMaxBody) return -1;

  int32_t msg_type;
  memcpy(&msg_type, fields, sizeof msg_type);
  const bool with_header = (fields[4] & 1) != 0;
  const bool with_body = (fields[4] & 2) != 0;
  const uint8_t state = fields[5];

  kestrel_fuzz::reset_daemon_state(kestrel_fuzz::diag_state_of_bits(state >> 1u));
  kestrel_fuzz::set_phone_scenario({});
  if ((state & 1) != 0) get_handle_for_sensor(0);
  if ((state & 8) != 0) set_mag_sensitivity(1.0f, 1.0f, 1.0f);
  kestrel_fuzz::phone_scenario b;
  b.open_fails = (state & 16) != 0;
  kestrel_fuzz::set_phone_scenario(b);
  set_properties((state & 32) != 0);

  sensor1_msg_header_s hdr;
  memcpy(&hdr.service_number, fields + 6, 4);
  memcpy(&hdr.msg_id, fields + 10, 4);
  hdr.txn_id = fields[14];
  hdr.msg_size = with_body ? static_cast<uint16_t>(body_size) : 0;

  void* body = nullptr;
  if (with_body) {
    body = sensor1_host_alloc_body(body_size);
    if (body_size > 0) memcpy(body, body_bytes, body_size);
  }
  rcv_test_msg(sensor1_callback_data(), with_header ? &hdr : nullptr, msg_type, body);
  // Without a header the callback cannot know whose body it is and leaves it alone.
  if (!with_header && body != nullptr) sensor1_free_msg_buf(nullptr, body);

  kestrel_fuzz::wait_for_daemon_threads();
  kestrel_fuzz::check_bodies_released();
  return 0;
}
