#include "kernel_peer.h"

#include <linux/netlink.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "kestrel_platform.h"

int32_t KernelFrame::word(size_t index) const {
  int32_t v = 0;
  if (payload.size() >= (index + 1) * 4) memcpy(&v, payload.data() + index * 4, 4);
  return v;
}

std::vector<uint8_t> command_frame_bytes(uint16_t command, const std::vector<uint8_t>& payload,
                                         std::optional<uint32_t> nlmsg_len) {
  std::vector<uint8_t> f(16 + payload.size(), 0);
  const uint32_t len = nlmsg_len.value_or(static_cast<uint32_t>(f.size()));
  memcpy(f.data(), &len, 4);
  memcpy(f.data() + 4, &command, 2);
  if (!payload.empty()) memcpy(f.data() + 16, payload.data(), payload.size());
  return f;
}

std::vector<uint8_t> command_frame(uint16_t command, const std::vector<int32_t>& words) {
  std::vector<uint8_t> payload(words.size() * 4);
  if (!words.empty()) memcpy(payload.data(), words.data(), payload.size());
  return command_frame_bytes(command, payload);
}

KernelPeer::KernelPeer(uint32_t port) {
  fd_ = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, platform_netlink_protocol());
  if (fd_ < 0) return;
  int size = 4 << 20;
  setsockopt(fd_, SOL_SOCKET, SO_RCVBUFFORCE, &size, sizeof size);
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = port;
  if (bind(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) {
    close(fd_);
    fd_ = -1;
  }
}

KernelPeer::~KernelPeer() {
  if (fd_ >= 0) close(fd_);
}

bool KernelPeer::send(const std::vector<uint8_t>& datagram, uint32_t to) {
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = to;
  return sendto(fd_, datagram.data(), datagram.size(), 0, reinterpret_cast<struct sockaddr*>(&addr),
                sizeof addr) == static_cast<ssize_t>(datagram.size());
}

bool KernelPeer::fill(std::chrono::milliseconds timeout) {
  struct pollfd p = {fd_, POLLIN, 0};
  if (poll(&p, 1, static_cast<int>(timeout.count())) <= 0) return false;
  uint8_t buf[65536];
  struct sockaddr_nl from;
  socklen_t from_len = sizeof from;
  ssize_t n = recvfrom(fd_, buf, sizeof buf, 0, reinterpret_cast<struct sockaddr*>(&from),
                       &from_len);
  if (n < 0) return false;
  size_t off = 0;
  while (n - static_cast<ssize_t>(off) >= 16) {
    KernelFrame f;
    memcpy(&f.len, buf + off, 4);
    memcpy(&f.type, buf + off + 4, 2);
    memcpy(&f.flags, buf + off + 6, 2);
    memcpy(&f.seq, buf + off + 8, 4);
    memcpy(&f.pid, buf + off + 12, 4);
    f.sender = from.nl_pid;
    size_t len = f.len < 16 ? 16 : f.len;
    if (off + len > static_cast<size_t>(n)) len = static_cast<size_t>(n) - off;
    f.raw.assign(buf + off, buf + off + len);
    f.payload.assign(buf + off + 16, buf + off + len);
    pending_.push_back(std::move(f));
    off += (len + 3) & ~size_t{3};
  }
  return true;
}

std::optional<KernelFrame> KernelPeer::receive(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (pending_.empty()) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() < 0 || !fill(left)) {
      if (std::chrono::steady_clock::now() >= deadline) return std::nullopt;
    }
  }
  KernelFrame f = std::move(pending_.front());
  pending_.pop_front();
  return f;
}

std::optional<KernelFrame> KernelPeer::receive_type(uint16_t type,
                                                    std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  size_t checked = 0;
  for (;;) {
    for (; checked < pending_.size(); ++checked) {
      if (pending_[checked].type == type) {
        KernelFrame f = std::move(pending_[checked]);
        pending_.erase(pending_.begin() + static_cast<long>(checked));
        return f;
      }
    }
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return std::nullopt;
    fill(left);
  }
}

std::vector<KernelFrame> KernelPeer::drain(std::chrono::milliseconds quiet) {
  std::vector<KernelFrame> out;
  for (;;) {
    auto f = receive(quiet);
    if (!f) return out;
    out.push_back(std::move(*f));
  }
}
