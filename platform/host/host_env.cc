// SPDX-License-Identifier: Apache-2.0
#include "host_env.h"

#include <linux/netlink.h>
#include <stdlib.h>
#include <string.h>

namespace {

const char* env_or(const char* name, const char* fallback) {
  const char* v = getenv(name);
  return (v != nullptr && v[0] != '\0') ? v : fallback;
}

long env_long(const char* name, long fallback) {
  const char* v = getenv(name);
  if (v == nullptr || v[0] == '\0') return fallback;
  char* end = nullptr;
  long n = strtol(v, &end, 0);
  return (end != v && *end == '\0') ? n : fallback;
}

double env_scale() {
  const char* v = getenv("KESTREL_TIME_SCALE");
  if (v == nullptr || v[0] == '\0') return 1.0;
  char* end = nullptr;
  double d = strtod(v, &end);
  return (end != v && *end == '\0' && d >= 0.0) ? d : 1.0;
}

host_env read_environment() {
  host_env e;
  e.netlink_protocol = static_cast<int>(env_long("KESTREL_NETLINK_PROTOCOL", NETLINK_USERSOCK));
  e.kernel_port = static_cast<uint32_t>(env_long("KESTREL_KERNEL_PORT", 100));
  e.sensor1_socket = env_or("KESTREL_SENSOR1_SOCKET", "/tmp/kestrel-sensor1.sock");
  e.properties = env_or("KESTREL_PROPERTIES", nullptr);
  e.sensor_reg = env_or("KESTREL_SENSOR_REG", nullptr);
  e.sysroot = env_or("KESTREL_SYSROOT", "");
  e.time_scale = env_scale();
  e.sensor1_init_result = static_cast<int>(env_long("KESTREL_SENSOR1_INIT_RESULT", 0));
  const char* diag_init = env_or("KESTREL_DIAG_INIT", "ok");
  e.diag_init_ok = strcmp(diag_init, "fail") != 0;
  e.diag_tx_mode_result = static_cast<int>(env_long("KESTREL_DIAG_TX_MODE_RESULT", 1));
  return e;
}

}  // namespace

const host_env& host_environment() {
  static const host_env env = read_environment();
  return env;
}
