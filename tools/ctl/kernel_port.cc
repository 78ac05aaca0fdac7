// SPDX-License-Identifier: Apache-2.0
#include "kernel_port.h"

#include <errno.h>
#include <fcntl.h>
#include <linux/netlink.h>
#include <poll.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include "capture.h"
#include "kernel_frame.h"
#include "kestrel_platform.h"

namespace kestrelctl {

uint32_t kernel_port_from_environment() {
  return platform_kernel_port_id();
}

namespace {

std::string& device_path() {
  static std::string path;
  return path;
}

bool fail(std::string* error, const std::string& message) {
  if (error != nullptr) *error = message;
  return false;
}

}  // namespace

KernelPort::~KernelPort() {
  if (fd_ >= 0) close(fd_);
}

bool KernelPort::open_socket(std::string* error) {
  fd_ = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, platform_netlink_protocol());
  return fd_ >= 0 || fail(error, std::string("cannot open a netlink socket: ") + strerror(errno));
}

void KernelPort::use_device(const std::string& path) {
  device_path() = path;
}

bool KernelPort::open_device(int flags, std::string* error) {
  device_ = true;
  fd_ = open(device_path().c_str(), flags | O_CLOEXEC);
  return fd_ >= 0 ||
         fail(error, "cannot open " + device_path() + ": " + strerror(errno) +
                         (errno == ENOENT ? " (is the kestrel_factory module loaded?)" : ""));
}

bool KernelPort::open_unbound(std::string* error) {
  return device_path().empty() ? open_socket(error) : open_device(O_WRONLY, error);
}

bool KernelPort::open_bound(uint32_t port, std::string* error) {
  if (!device_path().empty()) return open_device(O_RDWR, error);
  if (!open_socket(error)) return false;
  // Samples come fast; a larger queue keeps a slow reader from losing them (beyond the system's
  // limit where the process may raise it).
  int size = 4 << 20;
  if (setsockopt(fd_, SOL_SOCKET, SO_RCVBUFFORCE, &size, sizeof size) != 0) {
    size = 1 << 20;
    setsockopt(fd_, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
  }
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = port;
  if (bind(fd_, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) {
    const std::string message =
        errno == EADDRINUSE
            ? "port " + std::to_string(port) + " is in use: is another kestrelctl listening?"
            : "cannot bind netlink port " + std::to_string(port) + ": " + strerror(errno);
    close(fd_);
    fd_ = -1;
    return fail(error, message);
  }
  return true;
}

bool KernelPort::send(const std::vector<uint8_t>& datagram, std::string* error) {
  return send_to(kDaemonPortId, datagram, error);
}

bool KernelPort::send_to(uint32_t port, const std::vector<uint8_t>& datagram, std::string* error) {
  if (device_ && port != kDaemonPortId) {
    return fail(error, "the factory driver's device sends only to the daemon's port id");
  }
  struct sockaddr_nl addr;
  memset(&addr, 0, sizeof addr);
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = port;
  const ssize_t n = device_ ? write(fd_, datagram.data(), datagram.size())
                            : sendto(fd_, datagram.data(), datagram.size(), 0,
                                     reinterpret_cast<struct sockaddr*>(&addr), sizeof addr);
  if (n == static_cast<ssize_t>(datagram.size())) {
    if (capture_ != nullptr) {
      struct timeval now;
      gettimeofday(&now, nullptr);
      capture_->write(datagram.data(), datagram.size(), true, now);
    }
    return true;
  }
  if (n < 0 && errno == ECONNREFUSED) {
    return fail(error, "nothing listens on netlink port " + std::to_string(port) +
                           ": is kestreld running (in this network namespace)?");
  }
  return fail(error,
              std::string("cannot send to kestreld: ") + (n < 0 ? strerror(errno) : "short send"));
}

KernelPort::Wait KernelPort::read_datagram(int timeout_ms, std::string* error) {
  struct pollfd p = {fd_, POLLIN, 0};
  const int r = poll(&p, 1, timeout_ms);
  if (r == 0) return Wait::kTimeout;
  if (r < 0) {
    if (errno == EINTR) return Wait::kInterrupted;
    fail(error, std::string("cannot wait for frames: ") + strerror(errno));
    return Wait::kError;
  }
  thread_local uint8_t buf[65536];  // ports may receive on several threads at once
  struct sockaddr_nl from;
  socklen_t from_len = sizeof from;
  memset(&from, 0, sizeof from);
  // The device hands over what the daemon sent to port id 0, one datagram a read.
  from.nl_pid = kDaemonPortId;
  const ssize_t n = device_ ? read(fd_, buf, sizeof buf)
                            : recvfrom(fd_, buf, sizeof buf, 0,
                                       reinterpret_cast<struct sockaddr*>(&from), &from_len);
  if (n < 0) {
    if (errno == EINTR) return Wait::kInterrupted;
    if (errno == ENOBUFS) return Wait::kOverrun;
    fail(error, std::string("cannot receive frames: ") + strerror(errno));
    return Wait::kError;
  }
  gettimeofday(&received_at_, nullptr);
  if (capture_ != nullptr) capture_->write(buf, static_cast<size_t>(n), false, received_at_);
  for (Frame& f : split_frames(buf, static_cast<size_t>(n))) {
    f.sender = from.nl_pid;
    pending_.push_back(std::move(f));
  }
  return Wait::kFrames;
}

KernelPort::Wait KernelPort::receive(int timeout_ms, std::vector<Frame>* frames,
                                     std::string* error) {
  const Wait w = pending_.empty() ? read_datagram(timeout_ms, error) : Wait::kFrames;
  if (w == Wait::kFrames) {
    frames->assign(std::make_move_iterator(pending_.begin()),
                   std::make_move_iterator(pending_.end()));
    pending_.clear();
  }
  return w;
}

std::optional<Frame> KernelPort::next_frame_of_type(uint16_t type,
                                                    std::chrono::milliseconds timeout) {
  return next_matching([type](const Frame& f) { return f.type == type; }, timeout);
}

std::optional<Frame> KernelPort::next_frame(std::chrono::milliseconds timeout) {
  return next_matching([](const Frame&) { return true; }, timeout);
}

std::optional<Frame> KernelPort::next_matching(const std::function<bool(const Frame&)>& match,
                                               std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (size_t checked = 0;;) {
    for (; checked < pending_.size(); ++checked) {
      if (!match(pending_[checked])) continue;
      Frame f = std::move(pending_[checked]);
      pending_.erase(pending_.begin() + static_cast<long>(checked));
      return f;
    }
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() < 0) return std::nullopt;
    const Wait w = read_datagram(static_cast<int>(left.count()), nullptr);
    if (w == Wait::kTimeout || w == Wait::kError) return std::nullopt;
  }
}

std::vector<Frame> KernelPort::drain(std::chrono::milliseconds quiet) {
  std::vector<Frame> out;
  while (std::optional<Frame> f = next_frame(quiet)) out.push_back(std::move(*f));
  return out;
}

}  // namespace kestrelctl
