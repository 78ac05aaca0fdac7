// SPDX-License-Identifier: Apache-2.0
// Kernel frames as the factory driver builds and receives them: command frames for the daemon,
// the walk that splits a received datagram into frames, and the hex text the tool reads and
// prints. Layouts and numbers come from kernel_frame.h.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <array>
#include <optional>
#include <string>
#include <vector>

namespace kestrelctl {

// One frame of a datagram from the daemon.
struct Frame {
  uint32_t len = 0;  // nlmsg_len
  uint16_t type = 0;
  uint16_t flags = 0;
  uint32_t seq = 0;
  uint32_t pid = 0;
  std::vector<uint8_t> payload;  // bytes 16 .. nlmsg_len that the datagram holds
  std::vector<uint8_t> raw;      // the frame's bytes as received, header included
  uint32_t sender = 0;           // port id the datagram came from (set by KernelPort)
  // nlmsg_len below 16 or beyond the datagram, or a datagram shorter than a header: the payload
  // then holds every byte left, header included.
  bool malformed = false;
};

// A frame of payload bytes; nlmsg_len is 16 + the payload unless given (frames the driver
// would never send: nlmsg_len below a header, beyond the datagram, or short of the payload).
std::vector<uint8_t> build_frame(uint16_t type, const std::vector<uint8_t>& payload,
                                 std::optional<uint32_t> nlmsg_len = std::nullopt);

// A command frame: nlmsg_len = 16 + 4 x words, type = command, flags, seq and pid 0, then the
// words as signed 32-bit little-endian values.
std::vector<uint8_t> build_command(uint16_t command, const std::vector<int32_t>& words = {});

// A bulk-data frame (commands 22 to 26, 28, 29, 31, 32): sensor_type, the data length and the
// bytes. nlmsg_len counts header, the two words and the data; the datagram is padded with zero
// bytes to a multiple of 4 that nlmsg_len does not count.
std::vector<uint8_t> build_bigdata(uint16_t command, int32_t sensor_type,
                                   const std::vector<uint8_t>& data);

// The light sensor's hidden-hole coefficients (command 35): sensor_type 4, then d_factor, r, g,
// b, c, ct, ct_offset, th_high and th_low.
std::vector<uint8_t> build_hidden_hole(const std::array<int32_t, 9>& coefficients);

// Splits a datagram as the daemon's own frame walk does (4-byte aligned steps).
std::vector<Frame> split_frames(const uint8_t* data, size_t size);

// Hex digits, whitespace ignored anywhere ("14 00 00 00", "1400 0000"). On failure returns
// false with a message in error.
bool parse_hex(const std::string& text, std::vector<uint8_t>* bytes, std::string* error);

// Two lower-case digits a byte, separated by sep.
std::string to_hex(const uint8_t* data, size_t size, const char* sep = "");
std::string to_hex(const std::vector<uint8_t>& bytes, const char* sep = "");

// The daemon's name of a command number ("get_status", "bigdata", ...), "unknown" otherwise.
std::string command_name(uint32_t command);

}  // namespace kestrelctl
