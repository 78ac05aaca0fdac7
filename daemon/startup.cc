// SPDX-License-Identifier: Apache-2.0
#include "startup.h"

#include <linux/netlink.h>
#include <netinet/in.h>
#include <pthread.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "diag/diag_logging.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_channel/process_message.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"
#include "sensor1.h"
#include "service_link/response_waiter.h"
#include "service_link/service_callback.h"

void single_instance_guard() {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    KLOGE("single instance - sock failed!\n");
    exit(1);
  }
  struct sockaddr_in addr;
  memset(&addr, 0, sizeof addr);
  addr.sin_family = AF_INET;
  addr.sin_port = htons(kGuardPort);
  addr.sin_addr.s_addr = htonl(INADDR_ANY);
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) < 0) {
    KLOGE("Program is already running... can't run second instance!!!");
    close(fd);
    exit(1);
  }
  // The socket stays bound for the life of the process, so that a second daemon started while
  // this one runs is the one refused.
}

void* hh_read_data_thread(void*) {
  KLOGI("%s start\n", "hh_read_data_thread");
  platform_sleep_seconds(10);
  const uint8_t payload[kHhRefreshPayloadSize] = {kHhRefreshValue & 0xff, kHhRefreshValue >> 8};
  send_to_kernel(FRAME_HH_REFRESH, payload, sizeof payload);
  return nullptr;
}

namespace {

[[noreturn]] void receive_loop() {
  // Not cleared between successful receives: bytes past the latest datagram keep what an
  // earlier one left there, and the walk never reads them.
  static uint8_t buffer[kReceiveBufferSize];
  memset(buffer, 0, sizeof buffer);
  struct sockaddr_nl source;
  socklen_t source_len;
  int32_t previous = 0;
  int consecutive_failures = 0;
  for (;;) {
    source_len = sizeof source;
    KLOGI("%s: do while start = %d\n", "main", previous);
    for (;;) {
      ssize_t n = recvfrom(kernel_channel(), buffer, sizeof buffer, 0,
                           reinterpret_cast<struct sockaddr*>(&source), &source_len);
      if (n >= 0) {
        KLOGE("left = %d", static_cast<int>(n));
        process_message(buffer, static_cast<int32_t>(n));
        previous = static_cast<int32_t>(n);
        consecutive_failures = 0;
        break;
      }
      KLOGE("%s: recvfrom(netlink) %d\n", "main", -1);
      memset(buffer, 0, sizeof buffer);
      previous = -1;
      KLOGI("%s: do while start = %d\n", "main", previous);
      // A passing error (a full socket buffer) is retried at once; one that lasts is retried
      // ten times a second rather than in a busy loop.
      if (++consecutive_failures > 10) usleep(100 * 1000);
    }
  }
}

}  // namespace

int kestreld_main() {
  KLOGE("Factory Daemon Start!");
  platform_sleep_seconds(5);
  single_instance_guard();
  int r = sensor1_init();
  if (r != 0) {
    KLOGE("Exiting! sensor1_init failed with %d", r);
    exit(6);
  }
  KLOGE("Factory Daemon Start! 2");
  init_callback_locks();
  KLOGE("Factory Daemon Start! 3");
  init_response_waiters();
  KLOGE("Factory Daemon Start! 4");
  KLOGI("%s\n", "main");

  const int fd = open_and_bind_socket();
  set_kernel_channel(fd);
  if (fd < 0) {
    KLOGE("%s: open uevent fd failed\n", "main");
    return 0;
  }

  pthread_t diag_thread;
  KLOGI("%s SNS_DIAG_ENABLE_LOGGING enable\n", "main");
  if (pthread_create(&diag_thread, nullptr, diag_logging_start_thread, nullptr) != 0) {
    KLOGE("%s diag_logging_thread init err\n", "main");
    set_diag_logging_state(diag_state::stopped);
  } else {
    KLOGI("%s pthread_create success\n", "main");
  }

  pthread_t hh_thread;
  KLOGI("%s read/update light coef efs file\n", "main");
  if (pthread_create(&hh_thread, nullptr, hh_read_data_thread, nullptr) != 0) {
    KLOGE("%s hh_read_data_thread init err\n", "main");
  } else {
    KLOGI("%s hh_read_data_thread success\n", "main");
  }

  receive_loop();
}
