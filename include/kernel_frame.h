// SPDX-License-Identifier: Apache-2.0
// The kernel frame: one netlink message, a 16-byte nlmsghdr followed by the payload, in host
// byte order (little-endian). Inbound, nlmsg_type is the command number and the payload starts
// with sensor_type; outbound, nlmsg_type is the frame type and nlmsg_pid is the daemon's port id.
//
//   0        4        6        8        12       16
//   +--------+--------+--------+--------+--------+------------------------+
//   |nlmsg_len|  type  | flags  |  seq   |  pid   | payload ... padding    |
//   +--------+--------+--------+--------+--------+------------------------+
#pragma once

#include <stddef.h>
#include <stdint.h>

constexpr uint32_t kFrameHeaderSize = 16;
constexpr uint32_t kDaemonPortId = 20000;
constexpr uint32_t kReceiveBufferSize = 1024;
constexpr int kLastCommand = 36;

// Offsets of the inbound fields, from the start of the frame.
constexpr size_t kFrameLenOffset = 0;
constexpr size_t kFrameTypeOffset = 4;
constexpr size_t kSensorTypeOffset = 16;
constexpr size_t kArgumentOffset = 20;
constexpr size_t kCoefficientsOffset = 24;
constexpr size_t kBulkDataOffset = 24;

// Inbound command numbers.
enum kernel_command : uint16_t {
  NETLINK_MESSAGE_GET_STATUS = 0,
  NETLINK_MESSAGE_GET_RAW_DATA = 1,
  NETLINK_MESSAGE_STOP_RAW_DATA = 3,
  NETLINK_MESSAGE_READ_CALIB_DATA = 4,
  NETLINK_MESSAGE_STORE_CALIB_DATA = 6,
  NETLINK_MESSAGE_SELFTEST = 8,
  NETLINK_MESSAGE_GYRO_TEMPERATURE = 10,
  NETLINK_MESSAGE_MAG_READ_FUSE_ROM = 11,
  NETLINK_MESSAGE_MAG_READ_REGISTERS = 12,
  NETLINK_MESSAGE_ACCEL_LPF_ON = 15,
  NETLINK_MESSAGE_ACCEL_LPF_OFF = 16,
  NETLINK_MESSAGE_ACCEL_MOTOR_ENABLE = 17,
  NETLINK_MESSAGE_ACCEL_MOTOR_DISABLE = 18,
  NETLINK_MESSAGE_DUMP_REGISTER = 19,
  NETLINK_MESSAGE_DIAG_LOGGING = 27,
  NETLINK_MESSAGE_SET_HIDDEN_HOLE_DATA = 35,
  NETLINK_MESSAGE_HH_FILE_PERMISSIONS = 36,
};

// Outbound frame types.
enum kernel_frame_type : uint16_t {
  FRAME_STATUS = 0,
  FRAME_SAMPLE = 2,
  FRAME_STOP_RAW_DATA = 3,
  FRAME_CALIBRATION_REPORT = 5,
  FRAME_STORE_CALIBRATION = 7,
  FRAME_SELFTEST = 9,
  FRAME_GYRO_TEMPERATURE = 10,
  FRAME_MAG_FUSE_ROM = 11,
  FRAME_MAG_REGISTERS = 12,
  FRAME_GYRO_SELFTEST = 14,
  FRAME_ACCEL_LPF_ON = 15,
  FRAME_ACCEL_LPF_OFF = 16,
  FRAME_REGISTER_DUMP = 20,
  FRAME_THRESHOLD = 30,
  FRAME_HD_THRESHOLD = 33,
  FRAME_HH_REFRESH = 34,
};

// The bulk-data commands: one family, the number itself selects the data kind, which the light
// sensor's driver knows by its daf_request_id. The threshold reads are answered by the driver
// and the daemon passes the answer on as a frame; the other kinds are not answered.
struct bigdata_kind {
  uint16_t command;
  uint32_t daf_request_id;
  int32_t reply_frame;  // a kernel_frame_type, or -1
};
constexpr bigdata_kind kBigdataKinds[] = {
    {22, 100004, -1},
    {23, 100003, -1},
    {24, 100001, -1},
    {25, 100002, -1},
    {26, 100005, -1},
    {28, 100006, FRAME_THRESHOLD},
    {29, 100007, FRAME_THRESHOLD},
    {31, 100008, FRAME_HD_THRESHOLD},
    {32, 100009, FRAME_HD_THRESHOLD},
};

// The kind of a bulk-data command, null for numbers outside the family.
constexpr const bigdata_kind* bigdata_kind_of(uint32_t command) {
  for (const bigdata_kind& kind : kBigdataKinds) {
    if (kind.command == command) return &kind;
  }
  return nullptr;
}
constexpr bool is_bigdata_command(uint32_t command) {
  return bigdata_kind_of(command) != nullptr;
}

// The lowest and highest daf_request_id of the kinds answered as frame reply_frame: the driver
// answers those ids with threshold words.
constexpr uint32_t bigdata_request_id_bound(int32_t reply_frame, bool highest) {
  uint32_t bound = highest ? 0 : UINT32_MAX;
  for (const bigdata_kind& kind : kBigdataKinds) {
    if (kind.reply_frame != reply_frame) continue;
    if (highest ? kind.daf_request_id > bound : kind.daf_request_id < bound) {
      bound = kind.daf_request_id;
    }
  }
  return bound;
}

// nlmsg_len of an outbound frame: NLMSG_SPACE of the payload, alignment bytes included.
constexpr uint32_t frame_space(uint32_t payload_length) {
  return (payload_length + kFrameHeaderSize + 3) & ~3u;
}
static_assert(frame_space(0) == 16 && frame_space(2) == 20 && frame_space(129) == 148, "");

// Outbound payloads. Every record is written field by field into a zeroed record and passed to
// send_to_kernel as bytes; the asserts pin the layout the kernel driver parses.

struct status_reply {  // frame type 0
  uint8_t sensor_type;
  uint8_t no_response;
};
static_assert(sizeof(status_reply) == 2, "");

struct sample_frame {  // frame type 2
  int32_t code;
  int16_t value[6];
};
static_assert(sizeof(sample_frame) == 16 && offsetof(sample_frame, value) == 4, "");

struct stop_reply {  // frame type 3
  int32_t code;
  int32_t zero;
};
static_assert(sizeof(stop_reply) == 8, "");

struct calibration_report {  // frame type 5
  int32_t pdata_sensor_type;
  uint32_t word[9];
  int32_t result;
};
static_assert(sizeof(calibration_report) == 44 && offsetof(calibration_report, result) == 40, "");

struct store_calib_reply {  // frame type 7
  int32_t pdata_sensor_type;
  int32_t result;
};
static_assert(sizeof(store_calib_reply) == 8, "");

struct selftest_reply {  // frame type 9
  int32_t word[18];
};
static_assert(sizeof(selftest_reply) == 72, "");

struct gyro_reply {  // frame types 10 and 14
  int32_t word[15];
};
static_assert(sizeof(gyro_reply) == 60, "");

struct mag_reply {  // frame types 11 and 12
  int32_t code;
  int32_t fuse_rom[3];
  uint8_t registers[14];
  uint8_t zero[2];
  int32_t result;
};
static_assert(sizeof(mag_reply) == 36 && offsetof(mag_reply, registers) == 16 &&
                  offsetof(mag_reply, result) == 32,
              "");

struct lpf_result {  // frame types 15 and 16
  int32_t code;
  int32_t zero;
  int32_t lpf_on_off;
};
static_assert(sizeof(lpf_result) == 12, "");

struct register_dump_frame {  // frame type 20
  uint8_t index;
  uint8_t registers[128];
};
static_assert(sizeof(register_dump_frame) == 129 && offsetof(register_dump_frame, registers) == 1,
              "");

struct threshold_reply_frame {  // frame types 30 and 33
  int32_t high;
  int32_t low;
  int32_t hd_high;
  int32_t hd_low;
};
static_assert(sizeof(threshold_reply_frame) == 16, "");

// The hidden-hole refresh (frame type 34) carries one u16, 260.
constexpr uint32_t kHhRefreshPayloadSize = 2;
constexpr uint16_t kHhRefreshValue = 260;

// Every outbound frame type, with the payload its record fills and its name in the tools.
struct outbound_frame {
  kernel_frame_type type;
  uint32_t payload_size;
  const char* name;
};
constexpr outbound_frame kOutboundFrames[] = {
    {FRAME_STATUS, sizeof(status_reply), "status"},
    {FRAME_SAMPLE, sizeof(sample_frame), "sample"},
    {FRAME_STOP_RAW_DATA, sizeof(stop_reply), "stop"},
    {FRAME_CALIBRATION_REPORT, sizeof(calibration_report), "calibration_report"},
    {FRAME_STORE_CALIBRATION, sizeof(store_calib_reply), "store_calibration"},
    {FRAME_SELFTEST, sizeof(selftest_reply), "selftest"},
    {FRAME_GYRO_TEMPERATURE, sizeof(gyro_reply), "gyro_temperature"},
    {FRAME_MAG_FUSE_ROM, sizeof(mag_reply), "mag_fuse_rom"},
    {FRAME_MAG_REGISTERS, sizeof(mag_reply), "mag_registers"},
    {FRAME_GYRO_SELFTEST, sizeof(gyro_reply), "gyro_selftest"},
    {FRAME_ACCEL_LPF_ON, sizeof(lpf_result), "lpf_on"},
    {FRAME_ACCEL_LPF_OFF, sizeof(lpf_result), "lpf_off"},
    {FRAME_REGISTER_DUMP, sizeof(register_dump_frame), "register_dump"},
    {FRAME_THRESHOLD, sizeof(threshold_reply_frame), "threshold"},
    {FRAME_HD_THRESHOLD, sizeof(threshold_reply_frame), "hd_threshold"},
    {FRAME_HH_REFRESH, kHhRefreshPayloadSize, "hh_refresh"},
};

// The outbound frame of a type, null for the types the daemon never sends.
constexpr const outbound_frame* outbound_frame_of(uint32_t type) {
  for (const outbound_frame& f : kOutboundFrames) {
    if (f.type == type) return &f;
  }
  return nullptr;
}
