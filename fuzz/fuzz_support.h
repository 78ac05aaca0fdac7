// SPDX-License-Identifier: Apache-2.0
// What every fuzz target shares: a private directory of KESTREL_* files set up before the
// daemon's code first reads its environment, the phone (kestrel-sim's, reached in process on the
// caller's thread, so a write's answers are in before it returns), the interposed shell and log,
// the kernel channel that swallows frames after checking them, and the reset of the daemon's
// process state between inputs. A request the daemon writes that breaks the phone's request
// rules stops the run.
//
// Interposed in every fuzz binary:
//   system()               returns 0 for the commands the daemon issues, so no shell ever runs
//                          (KESTREL_FUZZ_LOG=1 prints each); any other command stops the run.
//   __android_log_print()  formats the line (so a bad format or argument is still caught) and
//                          drops it; KESTREL_FUZZ_LOG=1 prints it to stderr, for reproducing.
//   sendmsg()              (through the linker's --wrap) checks the frame, byte for byte, against
//                          the outbound frame rules and drops it.
//   pthread_create()       (through the linker's --wrap, for the daemon's calls only) counts the
//                          daemon's threads, so that an input can wait for the ones it started.
// Every check that fails prints what it saw and aborts, which libFuzzer reports as a crash.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>

#include "diag/diag_logging.h"
#include "tools/sim/healthy_phone.h"

namespace kestrel_fuzz {

// The files of one fuzz process, under a private temporary directory removed at exit.
struct fuzz_paths {
  std::string root;        // KESTREL_SYSROOT
  std::string properties;  // KESTREL_PROPERTIES
  std::string registry;    // KESTREL_SENSOR_REG
  std::string uart;        // <root>/data/misc/radio/uart.txt (not created)
};

// Creates the directory and the files with the contents given, sets every KESTREL_* variable
// (time scale 0) and initialises the daemon's locks and waiters as main does. Call once, from
// LLVMFuzzerInitialize, before any daemon or stand-in code runs.
const fuzz_paths& setup_fuzz_environment(const std::string& properties,
                                         const std::string& registry);

// How the phone and its sensor1 library behave for one input; the default is a healthy phone.
struct phone_scenario {
  bool open_fails = false;  // sensor1_open returns 11
  int alloc_result = 0;     // non-zero: every sensor1_alloc_msg_buf returns it and no buffer
  int write_result = 0;     // non-zero: every sensor1_write returns it (11: sent all the same)
  kestrel_sim::PhoneKnobs knobs;
};
void set_phone_scenario(const phone_scenario& scenario);

// Bodies of the sensor1 library not yet released; it must be 0 after every input.
void check_bodies_released();

// Replaces a file's contents.
void write_file(const std::string& path, const void* data, size_t size);

// Properties of a phone in normal use (logging allowed) and a calibrated phone's registry.
extern const char kNormalProperties[];
extern const char kCalibratedRegistry[];

// The daemon's process state back to its start: no connection and a full open budget, no pending
// hand-over, empty results, first-stream flags, the DIAG state given, the frame allocator plain.
void reset_daemon_state(diag_state diag);

// The DIAG state two bits of an input choose: stopped, logging, dumping, stopped.
diag_state diag_state_of_bits(uint32_t bits);

// Waits until every thread the daemon started has returned from its entry function, so that no
// thread of one input still allocates or frees while the next input runs or while libFuzzer
// checks this input for leaks. With the time scale 0 no thread of the daemon waits for anything;
// one that never ends is reported as a hang.
void wait_for_daemon_threads();

// Makes block number `block` (1 message header, 2 address, 3 vector, 4 frame buffer) of every
// outbound frame fail to allocate; 0 restores malloc.
void fail_frame_block(int block);

// Prints the message and aborts.
[[noreturn]] void fail(const char* format, ...) __attribute__((format(printf, 1, 2)));

}  // namespace kestrel_fuzz
