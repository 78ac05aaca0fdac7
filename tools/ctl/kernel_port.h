// The tool's end of the kernel channel: a netlink socket of the host build's protocol that
// sends command frames to the daemon's port id and, when bound to the kernel's port id,
// receives the frames the daemon sends to the kernel.
#pragma once

#include <stdint.h>

#include <string>
#include <vector>

#include "frame_codec.h"

namespace kestrelctl {

// The port id that plays the kernel: KESTREL_KERNEL_PORT, read as the daemon reads it (100
// when unset or not a number).
uint32_t kernel_port_from_environment();

class KernelPort {
 public:
  KernelPort() = default;
  ~KernelPort();
  KernelPort(const KernelPort&) = delete;
  KernelPort& operator=(const KernelPort&) = delete;

  // A socket that only sends; the system gives it a port id of its own, so the kernel's port
  // stays free for a listener elsewhere.
  bool open_unbound(std::string* error);
  // A socket bound to port, to receive the daemon's frames.
  bool open_bound(uint32_t port, std::string* error);

  // One datagram to the daemon's port id 20000.
  bool send(const std::vector<uint8_t>& datagram, std::string* error);

  enum class Wait { kFrames, kTimeout, kInterrupted, kOverrun, kError };
  // Waits up to timeout_ms (negative: without limit) for one datagram and splits it into
  // frames. kInterrupted when a signal ended the wait; kOverrun when the socket's queue
  // overflowed and frames were lost (receiving goes on afterwards).
  Wait receive(int timeout_ms, std::vector<Frame>* frames, std::string* error);

 private:
  bool open_socket(std::string* error);
  int fd_ = -1;
};

}  // namespace kestrelctl
