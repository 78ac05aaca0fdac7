// The command dispatcher: walks the kernel frames of one datagram and runs one command a frame.
#pragma once

#include <stdint.h>

// Walks buffer[0, count) (count at most 1024) with the netlink rules. Always returns 0.
int process_message(const uint8_t* buffer, int32_t count);

// Name of a command number for logs and tools ("NETLINK_MESSAGE_GET_STATUS"), null when the
// number has no action.
const char* command_name(uint32_t command);

// Smallest nlmsg_len that holds every field the command reads.
uint32_t command_min_frame_length(uint32_t command);
