// SPDX-License-Identifier: Apache-2.0
// The commands kestrel-soak and kestrel-chaos send: every kind the daemon serves, with the frame
// type of the reply a healthy phone brings.
#pragma once

#include <stdint.h>

#include <vector>

namespace kestrel_driver {

// One command datagram and the frame type of its reply from a healthy phone (-1: none).
struct Planned {
  std::vector<uint8_t> datagram;
  int reply = -1;
};

constexpr int kCommandKinds = 26;

// Cycle c of the commands: every kind the daemon serves, varied by c. Command 36 runs four shell
// commands, each a process of its own, so it comes in every tenth cycle only.
std::vector<Planned> cycle(long c);

// The command number of a command frame, or the type of a frame from the daemon.
uint16_t command_of(const std::vector<uint8_t>& datagram);

}  // namespace kestrel_driver
