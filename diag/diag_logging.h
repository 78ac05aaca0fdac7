// SPDX-License-Identifier: Apache-2.0
// On-device DIAG logging of the sensor processor: whether it may run, starting and stopping it,
// and its state (bit 0 logging enabled, bit 1 a dump thread started).
//
// Logging runs while the phone is not in DIAG mode: the USB configuration must not include
// "diag" and the UART selection file must not start with "CP". It is started
// by setting the buffering mode of the sensor peripheral through libdiag and then running
// kDiagMdlogStart; a dump stops the tool and starts it again.
#pragma once

#include <stdint.h>

// The shell commands that start the logging tool (in the background) and stop it.
extern const char kDiagMdlogStart[];
extern const char kDiagMdlogStop[];

// The logging state: bit 0 logging enabled, bit 1 a dump thread started. Its numbers are what
// command 27 logs.
enum class diag_state : int32_t {
  stopped = 0,  // at process start, after a stop, a forbidding check or a broken link
  logging = 1,  // the logging tool runs
  dumping = 3,  // a dump thread was started and has not restarted logging yet
};

// Shared by the main thread (command 27), both DIAG threads and the service callback without a
// lock: every read and write is one atomic operation on the whole 32-bit value, and a
// test-then-set made of several of them is not atomic as a whole.
diag_state diag_logging_state();
void set_diag_logging_state(diag_state state);

// 1 when logging may run, -1 when "persist.sys.usb.q_config" includes "diag".
int check_property();
// 1 when logging may run (no UART selection file, or one that does not start with "CP"), -1 when
// it starts with "CP" or cannot be opened or read.
int check_files();
// True when "ro.debug_level" forbids logging (after logging "%s stop logging\n").
// It only decides: it does not touch diag_logging_state. Every caller that gets true stops the
// state itself, right after (diag_logging_start_thread here, the broken-pipe recovery of the
// service callback).
bool check_loglevel();
// Sets the libdiag transmit mode of the sensor peripheral (2 before logging starts, 0 before it
// is stopped for a dump), with its own Diag_LSM_Init / Diag_LSM_DeInit pair. Returns 1 on
// success, -1 when libdiag cannot be initialised, otherwise the failing configuration result.
int sns_set_diag_mode(uint8_t mode);
// Starts logging when the checks allow it: mode 2, kDiagMdlogStart, a 5 s pause, logging. When
// the checks forbid it the state becomes stopped; when mode 2 cannot be set it is left as it was.
void sns_set_diag_tx_mode();

// Thread entries without argument, returning null.
// Started once by main: after 3 s, the debug-level check, the first open of the sensor service
// and the start of logging.
void* diag_logging_start_thread(void* unused);
// Started by command 27 with the state set to 3: a dump (mode 0, kDiagMdlogStop, a 2 s pause)
// and a restart unless logging was stopped meanwhile. A new one is started for every dump and
// nobody joins it, so it detaches itself: it must run on a thread of its own made by
// pthread_create.
void* diag_logging_thread(void* unused);
