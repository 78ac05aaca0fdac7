// SPDX-License-Identifier: Apache-2.0
// The command dispatcher: walks the kernel frames of one datagram and runs one command a frame.
#pragma once

#include <stdint.h>

// Walks buffer[0, count) (count at most 1024) with the netlink rules. Always returns 0.
int process_message(const uint8_t* buffer, int32_t count);
