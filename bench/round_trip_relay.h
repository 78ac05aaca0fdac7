// SPDX-License-Identifier: Apache-2.0
// The relays of the command round trip: the bare ping-pong that the daemon's round trip is set
// against, and the same with the duties of the daemon's design added, one at a time and all
// together. Each relay is a process of its own (round_trip_relay) with its own netlink port ids.
#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kestrel_bench {

// The daemon's duties that a relay can take on.
enum Duty : unsigned {
  kLogLines = 1,        // the daemon's log records of a self test, through liblog
  kHandOver = 2,        // the answer handed from a reader thread to the waiting main thread
  kResponseRecord = 4,  // a response record before the indication
};

struct Relay {
  const char* name;
  unsigned duties;
  const char* description;
};

constexpr Relay kRelays[] = {
    {"BarePingPong", 0, "bare ping-pong"},
    {"BareWithLogLines", kLogLines, "bare ping-pong + the daemon's log lines"},
    {"BareWithHandOver", kHandOver, "bare ping-pong + the thread hand-over"},
    {"BareWithResponseRecord", kResponseRecord, "bare ping-pong + the response record"},
    {"BareWithAllDuties", kLogLines | kHandOver | kResponseRecord,
     "bare ping-pong + all three duties"},
};
constexpr size_t kRelayCount = sizeof kRelays / sizeof kRelays[0];
constexpr size_t kAllDuties = kRelayCount - 1;

// Relay i's own port id, and the port id that plays the kernel for it.
constexpr uint32_t relay_port(size_t i) {
  return 20001 + static_cast<uint32_t>(i);
}
constexpr uint32_t relay_kernel_port(size_t i) {
  return 101 + static_cast<uint32_t>(i);
}

}  // namespace kestrel_bench
