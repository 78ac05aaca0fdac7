#include "kernel_port.h"

#include <errno.h>
#include <linux/netlink.h>
#include <poll.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "kernel_frame.h"

namespace kestrelctl {

uint32_t kernel_port_from_environment() {
  const char* v = getenv("KESTREL_KERNEL_PORT");
  if (v == nullptr || v[0] == '\0') return 100;
  char* end = nullptr;
  const long n = strtol(v, &end, 0);
  return (end != v && *end == '\0') ? static_cast<uint32_t>(n) : 100;
}

KernelPort::~KernelPort() {
  if (fd_ >= 0) close(fd_);
}

bool KernelPort::open_socket(std::string* error) {
  fd_ = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_USERSOCK);
  if (fd_ < 0) {
    *error = std::string("cannot open a netlink socket: ") + strerror(errno);
    return false;
  }
  return true;
}

bool KernelPort::open_unbound(std::string* error) {
  return open_socket(error);
}

bool KernelPort::open_bound(uint32_t port, std::string* error) {
  if (!open_socket(error)) return false;
  // Samples come fast; a larger queue keeps a slow terminal from losing them.
  int size = 1 << 20;
  setsockopt(fd_, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = port;
  if (bind(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) {
    if (errno == EADDRINUSE) {
      *error = "port " + std::to_string(port) + " is in use: is another kestrelctl listening?";
    } else {
      *error = "cannot bind netlink port " + std::to_string(port) + ": " + strerror(errno);
    }
    close(fd_);
    fd_ = -1;
    return false;
  }
  return true;
}

bool KernelPort::send(const std::vector<uint8_t>& datagram, std::string* error) {
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = kDaemonPortId;
  const ssize_t n = sendto(fd_, datagram.data(), datagram.size(), 0,
                           reinterpret_cast<struct sockaddr*>(&addr), sizeof addr);
  if (n == static_cast<ssize_t>(datagram.size())) return true;
  if (n < 0 && errno == ECONNREFUSED) {
    *error = "nothing listens on netlink port " + std::to_string(kDaemonPortId) +
             ": is kestreld running (in this network namespace)?";
  } else {
    *error = std::string("cannot send to kestreld: ") + (n < 0 ? strerror(errno) : "short send");
  }
  return false;
}

KernelPort::Wait KernelPort::receive(int timeout_ms, std::vector<Frame>* frames,
                                     std::string* error) {
  struct pollfd p = {fd_, POLLIN, 0};
  const int r = poll(&p, 1, timeout_ms);
  if (r == 0) return Wait::kTimeout;
  if (r < 0) {
    if (errno == EINTR) return Wait::kInterrupted;
    *error = std::string("cannot wait for frames: ") + strerror(errno);
    return Wait::kError;
  }
  static uint8_t buf[65536];
  const ssize_t n = recv(fd_, buf, sizeof buf, 0);
  if (n < 0) {
    if (errno == EINTR) return Wait::kInterrupted;
    if (errno == ENOBUFS) return Wait::kOverrun;
    *error = std::string("cannot receive frames: ") + strerror(errno);
    return Wait::kError;
  }
  *frames = split_frames(buf, static_cast<size_t>(n));
  return Wait::kFrames;
}

}  // namespace kestrelctl
