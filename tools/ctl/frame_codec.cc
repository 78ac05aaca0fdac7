// SPDX-License-Identifier: Apache-2.0
#include "frame_codec.h"

#include <ctype.h>

#include "byte_order.h"
#include "kernel_frame.h"
#include "kernel_sensors.h"

namespace kestrelctl {
namespace {

std::vector<uint8_t> frame_header(uint32_t len, uint16_t type, size_t size) {
  std::vector<uint8_t> f(size, 0);
  store_u32(f.data(), kFrameLenOffset, len);
  store_u16(f.data(), kFrameTypeOffset, type);
  return f;
}

int hex_digit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

}  // namespace

std::vector<uint8_t> build_frame(uint16_t type, const std::vector<uint8_t>& payload,
                                 std::optional<uint32_t> nlmsg_len) {
  const size_t size = kFrameHeaderSize + payload.size();
  std::vector<uint8_t> f =
      frame_header(nlmsg_len.value_or(static_cast<uint32_t>(size)), type, size);
  if (!payload.empty()) memcpy(f.data() + kFrameHeaderSize, payload.data(), payload.size());
  return f;
}

std::vector<uint8_t> build_command(uint16_t command, const std::vector<int32_t>& words) {
  std::vector<uint8_t> payload(4 * words.size());
  for (size_t i = 0; i < words.size(); ++i) store_i32(payload.data(), 4 * i, words[i]);
  return build_frame(command, payload);
}

std::vector<uint8_t> build_bigdata(uint16_t command, int32_t sensor_type,
                                   const std::vector<uint8_t>& data) {
  const uint32_t len = static_cast<uint32_t>(kBulkDataOffset + data.size());
  std::vector<uint8_t> f = frame_header(len, command, (len + 3) & ~3u);
  store_i32(f.data(), kSensorTypeOffset, sensor_type);
  store_i32(f.data(), kArgumentOffset, static_cast<int32_t>(data.size()));
  if (!data.empty()) memcpy(f.data() + kBulkDataOffset, data.data(), data.size());
  return f;
}

std::vector<uint8_t> build_hidden_hole(const std::array<int32_t, 9>& coefficients) {
  std::vector<int32_t> words{SENSOR_TYPE_LIGHT};
  words.insert(words.end(), coefficients.begin(), coefficients.end());
  return build_command(NETLINK_MESSAGE_SET_HIDDEN_HOLE_DATA, words);
}

std::vector<Frame> split_frames(const uint8_t* data, size_t size) {
  std::vector<Frame> frames;
  size_t offset = 0;
  while (offset < size) {
    const size_t left = size - offset;
    Frame f;
    if (left < kFrameHeaderSize) {
      // Alignment bytes after the last frame are no frame; a datagram this short is one.
      if (!frames.empty()) break;
      f.malformed = true;
      f.payload.assign(data + offset, data + size);
      f.raw = f.payload;
      frames.push_back(f);
      break;
    }
    f.len = load_u32(data, offset);
    f.type = load_u16(data, offset + 4);
    f.flags = load_u16(data, offset + 6);
    f.seq = load_u32(data, offset + 8);
    f.pid = load_u32(data, offset + 12);
    if (f.len < kFrameHeaderSize || f.len > left) {
      f.malformed = true;
      f.payload.assign(data + offset, data + size);
      f.raw = f.payload;
      frames.push_back(f);
      break;
    }
    f.payload.assign(data + offset + kFrameHeaderSize, data + offset + f.len);
    f.raw.assign(data + offset, data + offset + f.len);
    frames.push_back(f);
    offset += (f.len + 3) & ~3u;
  }
  return frames;
}

bool parse_hex(const std::string& text, std::vector<uint8_t>* bytes, std::string* error) {
  std::vector<uint8_t> out;
  int high = -1;
  for (size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (isspace(static_cast<unsigned char>(c))) continue;
    const int d = hex_digit(c);
    if (d < 0) {
      *error = std::string("'") + c + "' is not a hex digit";
      return false;
    }
    if (high < 0) {
      high = d;
    } else {
      out.push_back(static_cast<uint8_t>(high << 4 | d));
      high = -1;
    }
  }
  if (high >= 0) {
    *error = "odd number of hex digits";
    return false;
  }
  *bytes = std::move(out);
  return true;
}

std::string to_hex(const uint8_t* data, size_t size, const char* sep) {
  static const char kDigits[] = "0123456789abcdef";
  std::string s;
  for (size_t i = 0; i < size; ++i) {
    if (i > 0) s += sep;
    s += kDigits[data[i] >> 4];
    s += kDigits[data[i] & 15];
  }
  return s;
}

std::string to_hex(const std::vector<uint8_t>& bytes, const char* sep) {
  return to_hex(bytes.data(), bytes.size(), sep);
}

std::string command_name(uint32_t command) {
  if (is_bigdata_command(command)) return "bigdata";
  switch (command) {
    case NETLINK_MESSAGE_GET_STATUS:
      return "get_status";
    case NETLINK_MESSAGE_GET_RAW_DATA:
      return "get_raw_data";
    case NETLINK_MESSAGE_STOP_RAW_DATA:
      return "stop_raw_data";
    case NETLINK_MESSAGE_READ_CALIB_DATA:
      return "read_calib_data";
    case NETLINK_MESSAGE_STORE_CALIB_DATA:
      return "store_calib_data";
    case NETLINK_MESSAGE_SELFTEST:
      return "selftest";
    case NETLINK_MESSAGE_GYRO_TEMPERATURE:
      return "gyro_temperature";
    case NETLINK_MESSAGE_MAG_READ_FUSE_ROM:
      return "mag_read_fuse_rom";
    case NETLINK_MESSAGE_MAG_READ_REGISTERS:
      return "mag_read_registers";
    case NETLINK_MESSAGE_ACCEL_LPF_ON:
      return "accel_lpf_on";
    case NETLINK_MESSAGE_ACCEL_LPF_OFF:
      return "accel_lpf_off";
    case NETLINK_MESSAGE_ACCEL_MOTOR_ENABLE:
      return "accel_motor_enable";
    case NETLINK_MESSAGE_ACCEL_MOTOR_DISABLE:
      return "accel_motor_disable";
    case NETLINK_MESSAGE_DUMP_REGISTER:
      return "dump_register";
    case NETLINK_MESSAGE_DIAG_LOGGING:
      return "diag_logging";
    case NETLINK_MESSAGE_SET_HIDDEN_HOLE_DATA:
      return "set_hidden_hole_data";
    case NETLINK_MESSAGE_HH_FILE_PERMISSIONS:
      return "hh_file_permissions";
    default:
      return "unknown";
  }
}

}  // namespace kestrelctl
