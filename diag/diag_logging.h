// On-device DIAG logging of the sensor processor: whether it may run, starting and stopping it,
// and its state (bit 0 logging enabled, bit 1 a dump thread started).
#pragma once

#include <stdint.h>

extern const char kDiagMdlogStart[];
extern const char kDiagMdlogStop[];

// Every read and write is one atomic operation on the whole 32-bit value.
int32_t diag_logging_state();
void set_diag_logging_state(int32_t state);

int check_property();
int check_files();
// True when "ro.debug_level" forbids logging (after logging "%s stop logging\n").
bool check_loglevel();
int sns_set_diag_mode(uint8_t mode);
void sns_set_diag_tx_mode();

void* diag_logging_start_thread(void* unused);
void* diag_logging_thread(void* unused);
