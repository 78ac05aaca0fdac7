// SPDX-License-Identifier: Apache-2.0
// Little-endian field access for the fixed-layout records the daemon exchanges with the kernel
// driver and the sensor service. Fields are always copied with memcpy, never read through a
// cast of a byte pointer, so the alignment of a field inside a received buffer never matters.
#pragma once

#include <stdint.h>
#include <string.h>

static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__,
              "kernel frames and sensor1 bodies are little-endian and copied as they stand");

inline uint8_t load_u8(const void* base, size_t offset) {
  return static_cast<const uint8_t*>(base)[offset];
}

inline uint16_t load_u16(const void* base, size_t offset) {
  uint16_t v;
  memcpy(&v, static_cast<const uint8_t*>(base) + offset, sizeof v);
  return v;
}

inline uint32_t load_u32(const void* base, size_t offset) {
  uint32_t v;
  memcpy(&v, static_cast<const uint8_t*>(base) + offset, sizeof v);
  return v;
}

inline int32_t load_i32(const void* base, size_t offset) {
  int32_t v;
  memcpy(&v, static_cast<const uint8_t*>(base) + offset, sizeof v);
  return v;
}

inline void store_u8(void* base, size_t offset, uint8_t v) {
  static_cast<uint8_t*>(base)[offset] = v;
}

inline void store_u16(void* base, size_t offset, uint16_t v) {
  memcpy(static_cast<uint8_t*>(base) + offset, &v, sizeof v);
}

inline void store_u32(void* base, size_t offset, uint32_t v) {
  memcpy(static_cast<uint8_t*>(base) + offset, &v, sizeof v);
}

inline void store_i32(void* base, size_t offset, int32_t v) {
  memcpy(static_cast<uint8_t*>(base) + offset, &v, sizeof v);
}
