// SPDX-License-Identifier: Apache-2.0
// The one sensor1 connection of the process, opened on demand within a budget of consecutive
// failed attempts that lasts for the whole life of the process.
#pragma once

#include <stdint.h>

#include "sensor1.h"

constexpr int32_t kOpenRetryBudget = 50;

// Returns the current handle, opening the connection first when it is empty and the budget
// allows; an open in progress on another thread is waited for and its result taken. sensor_type
// is only logged. The result may be null.
sensor1_handle_s* get_handle_for_sensor(int32_t sensor_type);

// The current handle (null when empty), without opening anything.
sensor1_handle_s* current_sensor1_handle();

// The callback data registered with the connection (the address of the handle variable), for
// tests that call rcv_test_msg as the library does.
intptr_t sensor1_callback_data();

// Every sensor1 call on a handle goes between these two: lend_handle returns handle while it is
// still the current one (null once it was closed or replaced, so the call fails as on an empty
// handle), and the current handle is not closed until return_handle has given it back. Nothing
// that waits for the callback or for a response may run in between.
sensor1_handle_s* lend_handle(sensor1_handle_s* handle);
void return_handle(sensor1_handle_s* lent);

// Around the broken-pipe recovery on the callback thread: meanwhile the recovery alone closes
// the current handle, so that no other thread waits in sensor1_close for that callback.
void begin_link_recovery();
void end_link_recovery();

// Closes the current handle (if any) and empties it; used by the broken-pipe recovery. An open in
// progress on another thread is waited for first: the connection it makes is the broken one.
// Returns the close result (0 when there was none).
int close_sensor1_handle();

// Closes handle and empties the shared one when it is still the current handle and no recovery
// runs; a handle that the recovery replaced or closes itself is left to it (result 0).
int close_and_forget_handle(sensor1_handle_s* handle);

// Open attempts still allowed.
int32_t open_retry_budget();

// Process state back to its start values, for tests that run many daemons' worth of cases.
void reset_connection_for_testing();
