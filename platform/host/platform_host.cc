// SPDX-License-Identifier: Apache-2.0
// Host side of the platform interface: netlink protocol KESTREL_NETLINK_PROTOCOL (NETLINK_USERSOCK
// unless set), the kernel played by whoever binds KESTREL_KERNEL_PORT, paths under KESTREL_SYSROOT
// and delays scaled by KESTREL_TIME_SCALE.
//
// With KESTREL_NETLINK_PROTOCOL=23 and KESTREL_KERNEL_PORT=0 the daemon talks to the factory
// driver module as the phone's build does. Under qemu-user, which refuses every netlink protocol
// it has no translation for, NETLINK_USERSOCK among them, the arm64 tests set it to
// NETLINK_KOBJECT_UEVENT (15), which the emulator passes through untouched. The frames are the
// same bytes whichever protocol carries them.
#include <stdio.h>
#include <time.h>

#include "host_env.h"
#include "kestrel_platform.h"

int platform_netlink_protocol(void) {
  return host_environment().netlink_protocol;
}

uint32_t platform_kernel_port_id(void) {
  return host_environment().kernel_port;
}

const char* platform_path(const char* path, char* buf, size_t size) {
  snprintf(buf, size, "%s%s", host_environment().sysroot, path);
  return buf;
}

uint64_t platform_scaled_microseconds(uint64_t microseconds) {
  return static_cast<uint64_t>(static_cast<double>(microseconds) * host_environment().time_scale);
}

namespace {

void sleep_microseconds(uint64_t us) {
  struct timespec ts;
  ts.tv_sec = static_cast<time_t>(us / 1000000);
  ts.tv_nsec = static_cast<long>((us % 1000000) * 1000);
  while (nanosleep(&ts, &ts) != 0) {
  }
}

}  // namespace

void platform_sleep_seconds(unsigned seconds) {
  sleep_microseconds(platform_scaled_microseconds(uint64_t{seconds} * 1000000));
}

void platform_sleep_milliseconds(unsigned milliseconds) {
  sleep_microseconds(platform_scaled_microseconds(uint64_t{milliseconds} * 1000));
}
