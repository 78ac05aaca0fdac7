// SPDX-License-Identifier: Apache-2.0
// The commands the dispatcher carries out itself.
#pragma once

#include <stdint.h>

void run_selftest_command(const uint8_t* frame);         // command 8
void run_accel_lpf_command(int32_t code);                // commands 15 and 16
void run_dump_register_command(const uint8_t* frame);    // command 19
void run_diag_logging_command(const uint8_t* frame);     // command 27
void run_hh_file_permissions_command();                  // command 36
