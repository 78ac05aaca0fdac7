// SPDX-License-Identifier: Apache-2.0
// The KESTREL_* environment of the host build, read once on first use.
#pragma once

#include <stdint.h>

struct host_env {
  int netlink_protocol;        // KESTREL_NETLINK_PROTOCOL, default NETLINK_USERSOCK
  uint32_t kernel_port;        // KESTREL_KERNEL_PORT, default 100
  const char* sensor1_socket;  // KESTREL_SENSOR1_SOCKET
  const char* properties;      // KESTREL_PROPERTIES, null when unset
  const char* sensor_reg;      // KESTREL_SENSOR_REG, null when unset
  const char* sysroot;         // KESTREL_SYSROOT, "" when unset
  double time_scale;           // KESTREL_TIME_SCALE, default 1
  int sensor1_init_result;     // KESTREL_SENSOR1_INIT_RESULT, default 0
  bool diag_init_ok;           // KESTREL_DIAG_INIT != "fail"
  int diag_tx_mode_result;     // KESTREL_DIAG_TX_MODE_RESULT, default 1
};

const host_env& host_environment();
