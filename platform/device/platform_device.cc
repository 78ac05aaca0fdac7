// SPDX-License-Identifier: Apache-2.0
// Phone side of the platform interface: protocol 23 to the kernel factory driver at port id 0,
// absolute paths as they are, and the delays as they are.
#include <stdio.h>
#include <unistd.h>

#include "kestrel_platform.h"

int platform_netlink_protocol(void) { return 23; }

uint32_t platform_kernel_port_id(void) { return 0; }

const char* platform_path(const char* path, char* buf, size_t size) {
  snprintf(buf, size, "%s", path);
  return buf;
}

uint64_t platform_scaled_microseconds(uint64_t microseconds) { return microseconds; }

void platform_sleep_seconds(unsigned seconds) { sleep(seconds); }

void platform_sleep_milliseconds(unsigned milliseconds) { usleep(milliseconds * 1000u); }
