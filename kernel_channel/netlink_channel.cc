// SPDX-License-Identifier: Apache-2.0
#include "netlink_channel.h"

#include <linux/netlink.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <unistd.h>

#include <atomic>

#include "kernel_frame.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"

namespace {

std::atomic<int> g_kernel_channel{-1};
std::atomic<netmgr_malloc_fn> g_netmgr_malloc{&malloc};

void* netmgr_malloc(size_t size) { return g_netmgr_malloc.load()(size); }

}  // namespace

void set_netmgr_malloc_for_testing(netmgr_malloc_fn fn) {
  g_netmgr_malloc.store(fn != nullptr ? fn : &malloc);
}

void set_kernel_channel(int fd) { g_kernel_channel.store(fd); }

int kernel_channel() { return g_kernel_channel.load(); }

int open_and_bind_socket() {
  int fd = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, platform_netlink_protocol());
  if (fd < 0) {
    KLOGE("%s: socket failed (%d)\n", "open_and_bind_socket", -1);
    return -1;
  }
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = kDaemonPortId;
  addr.nl_groups = 0;
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) < 0) {
    KLOGE("%s: bind failed\n", "open_and_bind_socket");
    close(fd);
    return -1;
  }
  KLOGI("%s: while 1 starting\n", "open_and_bind_socket");
  return fd;
}

struct msghdr* netmgr_nl_alloc_msg(uint32_t size) {
  auto* msgh = static_cast<struct msghdr*>(netmgr_malloc(sizeof(struct msghdr)));
  if (msgh == nullptr) {
    KLOGE("failed on msgh netmgr_malloc: %d\n", static_cast<int>(sizeof(struct msghdr)));
    return nullptr;
  }
  auto* nladdr = static_cast<struct sockaddr_nl*>(netmgr_malloc(sizeof(struct sockaddr_nl)));
  if (nladdr == nullptr) {
    KLOGE("failed on nladdr netmgr_malloc: %d\n", static_cast<int>(sizeof(struct sockaddr_nl)));
    free(msgh);
    return nullptr;
  }
  auto* iov = static_cast<struct iovec*>(netmgr_malloc(sizeof(struct iovec)));
  if (iov == nullptr) {
    KLOGE("failed on iov netmgr_malloc: %d\n", static_cast<int>(sizeof(struct iovec)));
    free(nladdr);
    free(msgh);
    return nullptr;
  }
  void* buf = netmgr_malloc(size);
  if (buf == nullptr) {
    KLOGE("failed on buf netmgr_malloc: %d\n", static_cast<int>(size));
    free(iov);
    free(nladdr);
    free(msgh);
    return nullptr;
  }
  memset(nladdr, 0, sizeof *nladdr);
  nladdr->nl_family = AF_NETLINK;
  nladdr->nl_pid = platform_kernel_port_id();
  memset(msgh, 0, sizeof *msgh);
  msgh->msg_name = nladdr;
  msgh->msg_namelen = sizeof(struct sockaddr_nl);
  msgh->msg_iov = iov;
  msgh->msg_iovlen = 1;
  iov->iov_base = buf;
  iov->iov_len = size;
  return msgh;
}

int send_to_kernel(uint16_t type, const void* payload, uint32_t length) {
  const uint32_t len = frame_space(length);
  struct msghdr* msgh = netmgr_nl_alloc_msg(len);
  if (msgh == nullptr) {
    KLOGE("failed on netmgr_nl_alloc_msg\n");
    return -1;
  }
  auto* buf = static_cast<uint8_t*>(msgh->msg_iov->iov_base);
  struct nlmsghdr hdr;
  hdr.nlmsg_len = len;
  hdr.nlmsg_type = type;
  hdr.nlmsg_flags = 0;
  hdr.nlmsg_seq = 0;
  hdr.nlmsg_pid = kDaemonPortId;
  static_assert(sizeof hdr == kFrameHeaderSize, "");
  memcpy(buf, &hdr, sizeof hdr);
  if (length > 0) memcpy(buf + kFrameHeaderSize, payload, length);
  memset(buf + kFrameHeaderSize + length, 0, len - kFrameHeaderSize - length);
  // A lost frame leaves no trace: the kernel driver is the one that notices.
  (void)sendmsg(kernel_channel(), msgh, 0);
  void* name = msgh->msg_name;
  struct iovec* iov = msgh->msg_iov;
  free(iov->iov_base);
  free(iov);
  free(name);
  free(msgh);
  return 0;
}
