// A sensor1 library for the fuzz targets that answers at once, on the caller's thread: an open
// succeeds, bodies come from malloc (exactly the size asked, so AddressSanitizer sees any read
// past a body), and a write that takes its body delivers the matching response through the
// registered callback before it returns, followed, for a test request (and a status request of
// a sensor that exists), by the test indication, so wait_for_response finds its hand-over already
// made and never waits. A report or light-polling start is followed by one sample.
//
// Handles are a small ring of slots that are never freed: a closed handle stays a valid pointer
// and gets an error, as the phone's library gives one.
//
// Every request the daemon writes is checked: a known service and message id with that message's
// exact body size, and a known transaction id. A request that breaks the rules aborts the run.
#pragma once

#include <stddef.h>

namespace kestrel_fuzz {

enum class test_outcome {
  kPassed,             // result 0, the sensor's words
  kFailedWithCode,     // result 1, error code 7
  kFailedWithoutCode,  // result 1, no error code
};

// How the stand-in behaves; the default is a healthy phone.
struct sensor1_behaviour {
  bool open_fails = false;        // sensor1_open returns 11: the service is not up
  bool alloc_fails = false;       // sensor1_alloc_msg_buf returns 12 and no buffer
  int write_result = 0;           // 11: body taken, nothing answered; other non-zero: body left
  bool failed_responses = false;  // responses carry result 1, error 3
  bool no_indications = false;
  test_outcome outcome = test_outcome::kPassed;
};

void set_sensor1_behaviour(const sensor1_behaviour& behaviour);

// Allocates a body of exactly size bytes the way the library allocates the bodies it gives the
// callback; the callback releases it with sensor1_free_msg_buf.
void* alloc_callback_body(size_t size);

// Bodies allocated (by sensor1_alloc_msg_buf or alloc_callback_body) and not yet released.
long outstanding_bodies();

}  // namespace kestrel_fuzz
