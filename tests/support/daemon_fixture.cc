// SPDX-License-Identifier: Apache-2.0
#include "daemon_fixture.h"

#include "diag/diag_logging.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_channel/process_message.h"
#include "requests/raw_data.h"
#include "sensor1_host.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"

namespace {

// The daemon's socket is bound once per process, like the daemon's own.
int daemon_channel() {
  static const int fd = open_and_bind_socket();
  return fd;
}

}  // namespace

void DaemonFixture::SetUp() {
  log = std::make_unique<LogCapture>();
  kernel = std::make_unique<KernelPort>();
  ASSERT_TRUE(kernel->open_bound(100));
  set_kernel_channel(daemon_channel());
  ASSERT_GE(kernel_channel(), 0);
  sim = std::make_unique<kestrel_sim::Simulator>(test_socket_path(), false);
  reset_connection_for_testing();
  reset_response_waiters_for_testing();
  reset_factory_state_for_testing();
  reset_raw_data_flags_for_testing();
  set_diag_logging_state(diag_state::stopped);
  set_netmgr_malloc_for_testing(nullptr);
  stale_calls_at_setup = sensor1_host_stale_handle_calls();
  log->clear();
}

void DaemonFixture::TearDown() {
  reset_connection_for_testing();
  sim.reset();
  set_netmgr_malloc_for_testing(nullptr);
  EXPECT_EQ(sensor1_host_stale_handle_calls(), stale_calls_at_setup)
      << "a sensor1 call on a closed handle";
  if (check_bodies_released) {
    // Bodies still in flight on the library's thread get a moment to be delivered and freed.
    EXPECT_TRUE(eventually([] { return sensor1_host_outstanding_bodies() == 0; }, 500ms))
        << "a sensor1 body leaked";
  }
  kernel.reset();
  log.reset();
}

void DaemonFixture::dispatch(const std::vector<uint8_t>& datagram) {
  std::vector<uint8_t> buffer(1024, 0);
  std::copy(datagram.begin(), datagram.end(), buffer.begin());
  process_message(buffer.data(), static_cast<int32_t>(datagram.size()));
}

void DaemonFixture::command(uint16_t number, const std::vector<int32_t>& words) {
  dispatch(build_command(number, words));
}
