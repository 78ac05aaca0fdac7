// SPDX-License-Identifier: Apache-2.0
// The kernel's end of the kernel channel, over one of two transports. By default a netlink socket
// of the daemon's protocol that sends command frames to the daemon's port id and, when bound to
// the kernel's port id, receives the frames the daemon sends to the kernel: kestrelctl and the
// tests play the kernel through it. After use_device, the character device of the factory driver
// module (/dev/kestrel_factory), where the real kernel sends each frame written to it from port id
// 0 and hands every datagram the daemon sends to each file open for reading.
#pragma once

#include <stdint.h>
#include <sys/time.h>

#include <chrono>
#include <deque>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "frame_codec.h"

namespace kestrelctl {

class CaptureWriter;

// The port id that plays the kernel: KESTREL_KERNEL_PORT, as the daemon reads it (100 when unset
// or not a number).
uint32_t kernel_port_from_environment();

class KernelPort {
 public:
  KernelPort() = default;
  ~KernelPort();
  KernelPort(const KernelPort&) = delete;
  KernelPort& operator=(const KernelPort&) = delete;

  // Every port opened from now on in this process opens the device at path (a datagram a write,
  // a datagram a read) in place of a netlink socket.
  static void use_device(const std::string& path);

  // Each call that can fail says why in error, when given.
  // A socket that only sends; the system gives it a port id of its own, so the kernel's port
  // stays free for a listener elsewhere. On the device: opened for writing only.
  bool open_unbound(std::string* error = nullptr);
  // A socket bound to port, to receive the daemon's frames. On the device: opened for reading and
  // writing, port unused (the device receives what the daemon sends to port id 0).
  bool open_bound(uint32_t port, std::string* error = nullptr);
  int fd() const { return fd_; }

  // One datagram to the daemon's port id 20000, or to another port id.
  bool send(const std::vector<uint8_t>& datagram, std::string* error = nullptr);
  bool send_to(uint32_t port, const std::vector<uint8_t>& datagram, std::string* error = nullptr);

  enum class Wait { kFrames, kTimeout, kInterrupted, kOverrun, kError };
  // Waits up to timeout_ms (negative: without limit) for one datagram and splits it into
  // frames (the frames already queued by the calls below come first, without a wait).
  // kInterrupted when a signal ended the wait; kOverrun when the socket's queue overflowed and
  // frames were lost (receiving goes on afterwards).
  Wait receive(int timeout_ms, std::vector<Frame>* frames, std::string* error);

  // Frame by frame, over a queue of the frames received and not yet taken: the next frame; the
  // next frame of one type (frames of other types stay queued, in order); every frame that
  // comes until none has come for quiet. nullopt or empty when the time ran out.
  std::optional<Frame> next_frame(std::chrono::milliseconds timeout);
  std::optional<Frame> next_frame_of_type(uint16_t type, std::chrono::milliseconds timeout);
  std::vector<Frame> drain(std::chrono::milliseconds quiet);

  // From now on every datagram sent and received also goes to capture, stamped as it passes.
  void tap(CaptureWriter* capture) { capture_ = capture; }
  // The time stamp of the last datagram received.
  const struct timeval& received_at() const { return received_at_; }

 private:
  bool open_socket(std::string* error);
  bool open_device(int flags, std::string* error);
  // Waits for one datagram and queues its frames.
  Wait read_datagram(int timeout_ms, std::string* error);
  std::optional<Frame> next_matching(const std::function<bool(const Frame&)>& match,
                                     std::chrono::milliseconds timeout);
  int fd_ = -1;
  bool device_ = false;
  std::deque<Frame> pending_;
  CaptureWriter* capture_ = nullptr;
  struct timeval received_at_ = {};
};

}  // namespace kestrelctl
