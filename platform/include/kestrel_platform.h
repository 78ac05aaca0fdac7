// SPDX-License-Identifier: Apache-2.0
// What differs between the phone and a workstation, behind one small interface, so that the
// daemon's sources are the same in both builds. The device implementation is a few constants
// and plain sleeps; the host one reads the KESTREL_* environment once.
#pragma once

#include <stddef.h>
#include <stdint.h>

// Netlink protocol of the kernel factory driver: 23 on the phone, KESTREL_NETLINK_PROTOCOL on the
// host (NETLINK_USERSOCK unless set).
int platform_netlink_protocol(void);

// Port id the daemon sends its frames to: 0 (the kernel) on the phone.
uint32_t platform_kernel_port_id(void);

// The path the daemon opens for an absolute path of the phone. Writes into buf and returns it.
const char* platform_path(const char* path, char* buf, size_t size);

// Fixed delays. On the host every one is multiplied by KESTREL_TIME_SCALE.
void platform_sleep_seconds(unsigned seconds);
void platform_sleep_milliseconds(unsigned milliseconds);

// A nominal duration in microseconds as the delays above scale it (for deadlines).
uint64_t platform_scaled_microseconds(uint64_t microseconds);
