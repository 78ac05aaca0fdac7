// SPDX-License-Identifier: Apache-2.0
// The daemon's entry point and main thread: the single-instance guard, the start-up order, the
// two start-up threads and the endless receive loop.
#pragma once

// Runs the daemon. Returns only when the kernel channel cannot be opened (status 0); start-up
// failures before that end the process with their own status.
int kestreld_main();

// Ends the process with status 1 when another instance holds the guard port.
void single_instance_guard();

// Ten seconds after it starts, asks the kernel driver to refresh the light-sensor coefficients.
void* hh_read_data_thread(void* unused);

// The TCP port of the single-instance guard.
constexpr unsigned short kGuardPort = 59234;
