// SPDX-License-Identifier: Apache-2.0
// Sending a frame when one of its blocks cannot be allocated: the block's line, the others freed,
// and nothing sent. The frames that do go
// out are compared byte for byte wherever the daemon sends one.
#include <android/log.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <malloc.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include "kernel_channel/netlink_channel.h"
#include "kernel_port.h"
#include "log_capture.h"

using namespace std::chrono_literals;

namespace {

int g_fail_at = 0;
int g_calls = 0;
void* failing_malloc(size_t size) {
  return ++g_calls == g_fail_at ? nullptr : malloc(size);
}

TEST(SendToKernelTest, EachFailedBlockLogsItsLineFreesTheOthersAndSendsNothing) {
  set_kernel_channel(open_and_bind_socket());
  kestrelctl::KernelPort kernel;
  ASSERT_TRUE(kernel.open_bound(100));
  LogCapture log;
  static_assert(sizeof(struct msghdr) == 56 && sizeof(struct iovec) == 16,
                "the sizes logged are those of the 64-bit target");
  const char* lines[] = {"failed on msgh netmgr_malloc: 56\n",
                         "failed on nladdr netmgr_malloc: 12\n",
                         "failed on iov netmgr_malloc: 16\n", "failed on buf netmgr_malloc: 148\n"};
  for (g_fail_at = 1; g_fail_at <= 4; ++g_fail_at) {
    log.clear();
    g_calls = 0;
    set_netmgr_malloc_for_testing(failing_malloc);
    uint8_t payload[129] = {};
    EXPECT_EQ(send_to_kernel(20, payload, sizeof payload), -1);
    set_netmgr_malloc_for_testing(nullptr);
    EXPECT_THAT(log.messages(),
                ::testing::ElementsAre(lines[g_fail_at - 1], "failed on netmgr_nl_alloc_msg\n"));
    for (const LogRecord& r : log.records()) EXPECT_EQ(r.priority, 6);
    EXPECT_EQ(g_calls, g_fail_at) << "allocation stops at the first failure";
    EXPECT_FALSE(kernel.next_frame(50ms)) << "nothing is sent";
  }
  // The blocks taken before the failure are given back: with the log discarded (after a first
  // round that lets liblog set itself up), the heap holds no more than before.
  __android_log_set_logger([](const struct __android_logger_data*, const char*) {});
  for (int round = 0; round < 2; ++round) {
    for (g_fail_at = 2; g_fail_at <= 4; ++g_fail_at) {
      g_calls = 0;
      const size_t before = mallinfo2().uordblks;
      set_netmgr_malloc_for_testing(failing_malloc);
      uint8_t payload[129] = {};
      send_to_kernel(20, payload, sizeof payload);
      set_netmgr_malloc_for_testing(nullptr);
      if (round == 1) {
        EXPECT_EQ(mallinfo2().uordblks, before) << "block " << g_fail_at;
      }
    }
  }
}

}  // namespace
