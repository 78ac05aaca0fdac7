// Plays the kernel factory driver in tests: a netlink socket bound to the kernel's port id.
#pragma once

#include <stdint.h>

#include <chrono>
#include <deque>
#include <optional>
#include <vector>

struct KernelFrame {
  uint32_t len = 0;  // nlmsg_len
  uint16_t type = 0;
  uint16_t flags = 0;
  uint32_t seq = 0;
  uint32_t pid = 0;
  std::vector<uint8_t> payload;  // bytes 16 .. nlmsg_len, alignment bytes included
  std::vector<uint8_t> raw;      // the whole frame as received
  uint32_t sender = 0;           // port id the datagram came from
  int32_t word(size_t index) const;  // signed 32-bit little-endian payload word
};

// A command frame with payload words (nlmsg_len = 16 + 4 * words, the pid 0 of the kernel).
std::vector<uint8_t> command_frame(uint16_t command, const std::vector<int32_t>& words = {});
// A command frame with raw payload bytes; nlmsg_len is 16 + payload unless given.
std::vector<uint8_t> command_frame_bytes(uint16_t command, const std::vector<uint8_t>& payload,
                                         std::optional<uint32_t> nlmsg_len = std::nullopt);

class KernelPeer {
 public:
  explicit KernelPeer(uint32_t port = 100);
  ~KernelPeer();
  KernelPeer(const KernelPeer&) = delete;
  KernelPeer& operator=(const KernelPeer&) = delete;

  bool ok() const { return fd_ >= 0; }
  int fd() const { return fd_; }

  // Sends one datagram to the daemon's port id.
  bool send(const std::vector<uint8_t>& datagram, uint32_t to = 20000);
  // The next frame the daemon sent (datagrams are split into frames).
  std::optional<KernelFrame> receive(std::chrono::milliseconds timeout);
  // The next frame of the given type; frames of other types before it are kept for receive().
  std::optional<KernelFrame> receive_type(uint16_t type, std::chrono::milliseconds timeout);
  // Every frame that arrives until nothing has come for quiet.
  std::vector<KernelFrame> drain(std::chrono::milliseconds quiet);

 private:
  bool fill(std::chrono::milliseconds timeout);
  int fd_ = -1;
  std::deque<KernelFrame> pending_;
};
