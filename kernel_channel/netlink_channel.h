// SPDX-License-Identifier: Apache-2.0
// The kernel channel: one netlink socket bound to the daemon's port id, and the one function
// through which every outbound frame leaves the daemon.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/socket.h>

// Creates the netlink socket and binds it to port id 20000. Returns the descriptor or -1.
int open_and_bind_socket();

// The socket descriptor, written once by main before any thread that sends is started.
void set_kernel_channel(int fd);
int kernel_channel();

// Allocates a message header addressed to the kernel, with its address, one vector entry and a
// frame buffer of size bytes attached. Returns null (after logging) when a block cannot be had.
struct msghdr* netmgr_nl_alloc_msg(uint32_t size);

// Builds one kernel frame of the given type around payload and sends it. Callable from any
// thread. Returns 0 when the frame was handed to the socket, -1 when it could not be allocated.
int send_to_kernel(uint16_t type, const void* payload, uint32_t length);

// Allocation seam for the four blocks of a frame; tests make it fail on a chosen block.
using netmgr_malloc_fn = void* (*)(size_t size);
void set_netmgr_malloc_for_testing(netmgr_malloc_fn fn);
