// The one sensor1 connection of the process, opened on demand within a budget of consecutive
// failed attempts that lasts for the whole life of the process.
#pragma once

#include <stdint.h>

#include "sensor1.h"

constexpr int32_t kOpenRetryBudget = 50;

// Returns the current handle, opening the connection first when it is empty and the budget
// allows. sensor_type is only logged. The result may be null.
sensor1_handle_s* get_handle_for_sensor(int32_t sensor_type);

// The same, for the library's callback thread: an open in progress on another thread is not
// waited for (the empty handle is returned), so that thread never waits on one that may itself be
// waiting in sensor1_close for the callback to return.
sensor1_handle_s* get_handle_without_waiting(int32_t sensor_type);

// The current handle (null when empty), without opening anything.
sensor1_handle_s* current_sensor1_handle();

// The callback data registered with the connection (the address of the handle variable), for
// tests that call rcv_test_msg as the library does.
intptr_t sensor1_callback_data();

// Closes the current handle (if any) and empties it; used by the broken-pipe recovery. A
// connection being opened at that moment is the broken one: its opener closes it. Returns the
// close result (0 when there was none).
int close_sensor1_handle();

// Closes handle and empties the shared one when it is still the current handle; a handle that
// the broken-pipe recovery already replaced is not closed twice (result 0).
int close_and_forget_handle(sensor1_handle_s* handle);

// Open attempts still allowed.
int32_t open_retry_budget();

// Process state back to its start values, for tests that run many daemons' worth of cases.
void reset_connection_for_testing();
