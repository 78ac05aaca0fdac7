// Frame building and sending: the exact bytes every frame leaves with, and what happens when a
// block of the frame cannot be allocated.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <atomic>

#include "kernel_channel/netlink_channel.h"
#include "kernel_port.h"
#include "log_capture.h"

using ::testing::ElementsAre;
using namespace std::chrono_literals;

namespace {

int daemon_channel() {
  static const int fd = open_and_bind_socket();
  return fd;
}

class SendToKernelTest : public ::testing::Test {
 protected:
  void SetUp() override {
    set_kernel_channel(daemon_channel());
    ASSERT_GE(kernel_channel(), 0);
    ASSERT_TRUE(kernel.open_bound(100));
    log.clear();
  }
  void TearDown() override { set_netmgr_malloc_for_testing(nullptr); }

  LogCapture log;
  kestrelctl::KernelPort kernel;
};

TEST_F(SendToKernelTest, FrameLengthIsNlmsgSpaceWithZeroedPadding) {
  struct Case {
    uint32_t payload;
    uint32_t nlmsg_len;
  };
  for (Case c : {Case{0, 16}, Case{2, 20}, Case{16, 32}, Case{129, 148}}) {
    std::vector<uint8_t> payload(c.payload);
    for (size_t i = 0; i < payload.size(); ++i) payload[i] = static_cast<uint8_t>(0xA0 + i);
    ASSERT_EQ(send_to_kernel(20, payload.data(), c.payload), 0);
    auto f = kernel.next_frame(2000ms);
    ASSERT_TRUE(f) << "payload " << c.payload;
    EXPECT_EQ(f->raw.size(), c.nlmsg_len);
    EXPECT_EQ(f->len, c.nlmsg_len);
    EXPECT_EQ(f->type, 20);
    EXPECT_EQ(f->flags, 0);
    EXPECT_EQ(f->seq, 0u);
    EXPECT_EQ(f->pid, 20000u);
    EXPECT_EQ(f->sender, 20000u) << "frames come from the daemon's own port id";
    ASSERT_EQ(f->payload.size(), c.nlmsg_len - 16);
    for (uint32_t i = 0; i < c.payload; ++i) EXPECT_EQ(f->payload[i], payload[i]);
    for (uint32_t i = c.payload; i < f->payload.size(); ++i) {
      EXPECT_EQ(f->payload[i], 0) << "padding byte " << i << " of payload " << c.payload;
    }
  }
  EXPECT_TRUE(log.messages().empty()) << "a frame that goes out logs nothing";
}

TEST_F(SendToKernelTest, HeaderBytesAreLittleEndianInOrder) {
  const uint8_t payload[2] = {0x04, 0x01};
  send_to_kernel(34, payload, 2);
  auto f = kernel.next_frame(2000ms);
  ASSERT_TRUE(f);
  EXPECT_THAT(f->raw, ElementsAre(20, 0, 0, 0, 34, 0, 0, 0, 0, 0, 0, 0, 0x20, 0x4e, 0, 0, 0x04,
                                  0x01, 0, 0));
}

// Allocation seam that fails the n-th allocation of a frame and counts what is still held.
std::atomic<int> g_fail_at{0};
std::atomic<int> g_calls{0};
std::atomic<int> g_live{0};
void* counting_malloc(size_t size) {
  if (++g_calls == g_fail_at.load()) return nullptr;
  ++g_live;
  return malloc(size);
}

TEST_F(SendToKernelTest, EachFailedBlockLogsItsLineFreesTheOthersAndSendsNothing) {
  struct Case {
    int fail_at;
    const char* line;
  };
  const Case cases[] = {
      {1, "failed on msgh netmgr_malloc: 56\n"},
      {2, "failed on nladdr netmgr_malloc: 12\n"},
      {3, "failed on iov netmgr_malloc: 16\n"},
      {4, "failed on buf netmgr_malloc: 148\n"},
  };
  static_assert(sizeof(struct msghdr) == 56 && sizeof(struct iovec) == 16,
                "the sizes logged are those of the 64-bit target");
  for (const Case& c : cases) {
    log.clear();
    g_fail_at = c.fail_at;
    g_calls = 0;
    g_live = 0;
    set_netmgr_malloc_for_testing(counting_malloc);
    uint8_t payload[129] = {};
    EXPECT_EQ(send_to_kernel(20, payload, sizeof payload), -1);
    set_netmgr_malloc_for_testing(nullptr);
    EXPECT_THAT(log.messages(), ElementsAre(c.line, "failed on netmgr_nl_alloc_msg\n"));
    for (const LogRecord& r : log.records()) EXPECT_EQ(r.priority, 6);
    EXPECT_EQ(g_calls.load(), c.fail_at) << "allocation stops at the first failure";
    EXPECT_FALSE(kernel.next_frame(50ms)) << "nothing is sent";
  }
}

TEST(AllocMsgTest, MessageIsAddressedToTheKernelPortWithOneVector) {
  struct msghdr* m = netmgr_nl_alloc_msg(24);
  ASSERT_NE(m, nullptr);
  EXPECT_EQ(m->msg_namelen, 12u);
  EXPECT_EQ(m->msg_iovlen, 1u);
  EXPECT_EQ(m->msg_iov->iov_len, 24u);
  EXPECT_EQ(m->msg_control, nullptr);
  EXPECT_EQ(m->msg_flags, 0);
  const auto* addr = static_cast<const struct sockaddr_nl*>(m->msg_name);
  EXPECT_EQ(addr->nl_family, AF_NETLINK);
  EXPECT_EQ(addr->nl_pid, 100u) << "the host's kernel port id";
  EXPECT_EQ(addr->nl_groups, 0u);
  free(m->msg_iov->iov_base);
  free(m->msg_iov);
  free(m->msg_name);
  free(m);
}

}  // namespace
