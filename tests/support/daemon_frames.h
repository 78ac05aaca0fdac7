// SPDX-License-Identifier: Apache-2.0
// Frames as kestreld sends them to the kernel, built byte by byte for the tests to compare.
#pragma once

#include <stdint.h>
#include <string.h>

#include <vector>

#include "byte_order.h"

using Bytes = std::vector<uint8_t>;

// Signed 32-bit little-endian words.
inline Bytes words(const std::vector<int32_t>& w) {
  Bytes b(4 * w.size());
  for (size_t i = 0; i < w.size(); ++i) store_i32(b.data(), 4 * i, w[i]);
  return b;
}

// One frame: nlmsg_len counts the alignment bytes after the payload, the pid is 20000.
inline Bytes daemon_frame(uint16_t type, const Bytes& payload) {
  Bytes f(16 + ((payload.size() + 3) & ~size_t{3}), 0);
  store_u32(f.data(), 0, static_cast<uint32_t>(f.size()));
  store_u16(f.data(), 4, type);
  store_u32(f.data(), 12, 20000);
  if (!payload.empty()) memcpy(f.data() + 16, payload.data(), payload.size());
  return f;
}

// The frame whose payload is the words w, padded with zero words to n.
inline Bytes word_frame(uint16_t type, std::vector<int32_t> w, size_t n = 0) {
  if (w.size() < n) w.resize(n, 0);
  return daemon_frame(type, words(w));
}
