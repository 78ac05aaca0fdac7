// The phone is 64-bit ARM. These checks run in every build (the workstation's, the arm64 one
// under qemu-user and the device's own test suite): the system records the daemon builds its
// frames in and whose sizes its allocation-failure lines report. (The daemon's own records
// carry static_asserts of their layout.)
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <netinet/in.h>
#include <stddef.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <vector>

namespace {

struct Field {
  const char* name;
  size_t actual;
  size_t expected;
};

#define FIELD(record, member, expected)                     \
  Field {                                                   \
#record "." #member, offsetof(record, member), expected \
  }
#define SIZE(record, expected)                  \
  Field {                                       \
    "sizeof " #record, sizeof(record), expected \
  }

void expect_layout(const std::vector<Field>& fields) {
  for (const Field& f : fields) EXPECT_EQ(f.actual, f.expected) << f.name;
}

TEST(AbiTest, SystemRecordsOfTheFramesHaveThe64BitLayout) {
  expect_layout({
      SIZE(struct nlmsghdr, 16),
      FIELD(struct nlmsghdr, nlmsg_len, 0),
      FIELD(struct nlmsghdr, nlmsg_type, 4),
      FIELD(struct nlmsghdr, nlmsg_flags, 6),
      FIELD(struct nlmsghdr, nlmsg_seq, 8),
      FIELD(struct nlmsghdr, nlmsg_pid, 12),
      SIZE(struct sockaddr_nl, 12),
      FIELD(struct sockaddr_nl, nl_family, 0),
      FIELD(struct sockaddr_nl, nl_pid, 4),
      FIELD(struct sockaddr_nl, nl_groups, 8),
      SIZE(struct msghdr, 56),
      FIELD(struct msghdr, msg_name, 0),
      FIELD(struct msghdr, msg_namelen, 8),
      FIELD(struct msghdr, msg_iov, 16),
      FIELD(struct msghdr, msg_iovlen, 24),
      FIELD(struct msghdr, msg_control, 32),
      FIELD(struct msghdr, msg_controllen, 40),
      FIELD(struct msghdr, msg_flags, 48),
      SIZE(struct iovec, 16),
      FIELD(struct iovec, iov_base, 0),
      FIELD(struct iovec, iov_len, 8),
      // The single-instance guard's address.
      SIZE(struct sockaddr_in, 16),
      FIELD(struct sockaddr_in, sin_family, 0),
      FIELD(struct sockaddr_in, sin_port, 2),
      FIELD(struct sockaddr_in, sin_addr, 4),
  });
}

}  // namespace
