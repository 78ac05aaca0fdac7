// SPDX-License-Identifier: Apache-2.0
// Command 35 (the light sensor's hidden-hole coefficients) and the bulk-data commands.
#pragma once

#include <stdint.h>

// Each sends one daf_request to the light sensor's driver and returns 0 when it was written, -1
// or the write's error otherwise; neither waits for an answer.
int set_hidden_hole_data(const uint8_t* frame);
// A data length that is negative, above 256 or beyond the bytes of its frame is refused with one
// error line ("send_bigdata: command 24 refused: data length 300 (frame carries 8 bytes, at
// most 256)") before anything else is done: no request, no copy.
int send_bigdata(const uint8_t* frame);
