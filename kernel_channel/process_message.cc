// SPDX-License-Identifier: Apache-2.0
#include "process_message.h"

#include <linux/netlink.h>
#include <string.h>

#include "calibration/calibration_store.h"
#include "calibration/hidden_hole.h"
#include "calibration/registry_reader.h"
#include "dispatcher_commands.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "requests/raw_data.h"
#include "requests/register_access.h"
#include "requests/selftest.h"
#include "requests/status_requests.h"

namespace {

// One entry a command number. Handlers read their fields at fixed offsets from the frame start;
// min_frame_length is the nlmsg_len that covers the furthest of them, so a handler never reads
// past its frame (and the walk never lets a frame run past the bytes received).
struct command_entry {
  const char* name;
  uint32_t min_frame_length;
  void (*run)(const uint8_t* frame);
};

constexpr uint32_t kWithSensorType = kSensorTypeOffset + 4;
constexpr uint32_t kWithArgument = kArgumentOffset + 4;
constexpr uint32_t kWithCoefficients = kCoefficientsOffset + 8 * 4;

constexpr command_entry kNone = {nullptr, kFrameHeaderSize, nullptr};
// Every command of the bulk-data family (is_bigdata_command) runs this one; their rows in
// kCommands are empty.
constexpr command_entry kBigdata = {"NETLINK_MESSAGE_BIGDATA", kWithArgument,
                                    [](const uint8_t* f) { send_bigdata(f); }};

constexpr command_entry kCommands[kLastCommand + 1] = {
    /* 0 */ {"NETLINK_MESSAGE_GET_STATUS", kWithSensorType,
             [](const uint8_t* f) { get_status(f); }},
    /* 1 */
    {"NETLINK_MESSAGE_GET_RAW_DATA", kWithSensorType, [](const uint8_t* f) { get_raw_data(f); }},
    /* 2 */ kNone,
    /* 3 */
    {"NETLINK_MESSAGE_STOP_RAW_DATA", kWithSensorType, [](const uint8_t* f) { stop_raw_data(f); }},
    /* 4 */
    {"NETLINK_MESSAGE_READ_CALIB_DATA", kWithSensorType,
     [](const uint8_t* f) { read_calib_data(f); }},
    /* 5 */ kNone,
    /* 6 */
    {"NETLINK_MESSAGE_STORE_CALIB_DATA", kWithArgument,
     [](const uint8_t* f) { store_calib_data(f); }},
    /* 7 */ kNone,
    /* 8 */ {"NETLINK_MESSAGE_SELFTEST", kWithSensorType, &run_selftest_command},
    /* 9 */ kNone,
    /* 10 */
    {"NETLINK_MESSAGE_GYRO_TEMPERATURE", kFrameHeaderSize,
     [](const uint8_t*) {
       get_selftest_result(11);
       send_gyro_selftest_result();
     }},
    /* 11 */
    {"NETLINK_MESSAGE_MAG_READ_FUSE_ROM", kFrameHeaderSize,
     [](const uint8_t*) { get_mag_register_data(8, 1); }},
    /* 12 */
    {"NETLINK_MESSAGE_MAG_READ_REGISTERS", kFrameHeaderSize,
     [](const uint8_t*) { get_mag_register_data(9, 1); }},
    /* 13 */ kNone,
    /* 14 */ kNone,
    /* 15 */
    {"NETLINK_MESSAGE_ACCEL_LPF_ON", kFrameHeaderSize,
     [](const uint8_t*) { run_accel_lpf_command(12); }},
    /* 16 */
    {"NETLINK_MESSAGE_ACCEL_LPF_OFF", kFrameHeaderSize,
     [](const uint8_t*) { run_accel_lpf_command(13); }},
    /* 17 */
    {"NETLINK_MESSAGE_ACCEL_MOTOR_ENABLE", kFrameHeaderSize,
     [](const uint8_t*) { set_accel_motor(14); }},
    /* 18 */
    {"NETLINK_MESSAGE_ACCEL_MOTOR_DISABLE", kFrameHeaderSize,
     [](const uint8_t*) { set_accel_motor(15); }},
    /* 19 */ {"NETLINK_MESSAGE_DUMP_REGISTER", kWithSensorType, &run_dump_register_command},
    /* 20 */ kNone,
    /* 21 */ kNone,
    /* 22 */ kNone,
    /* 23 */ kNone,
    /* 24 */ kNone,
    /* 25 */ kNone,
    /* 26 */ kNone,
    /* 27 */ {"NETLINK_MESSAGE_DIAG_LOGGING", kWithArgument, &run_diag_logging_command},
    /* 28 */ kNone,
    /* 29 */ kNone,
    /* 30 */ kNone,
    /* 31 */ kNone,
    /* 32 */ kNone,
    /* 33 */ kNone,
    /* 34 */ kNone,
    /* 35 */
    {"NETLINK_MESSAGE_SET_HIDDEN_HOLE_DATA", kWithCoefficients,
     [](const uint8_t* f) { set_hidden_hole_data(f); }},
    /* 36 */
    {"NETLINK_MESSAGE_HH_FILE_PERMISSIONS", kFrameHeaderSize,
     [](const uint8_t*) { run_hh_file_permissions_command(); }},
};

// The entry of a command number, null when the number has no action.
const command_entry* command_entry_of(uint16_t command) {
  if (is_bigdata_command(command)) return &kBigdata;
  if (command > kLastCommand || kCommands[command].run == nullptr) return nullptr;
  return &kCommands[command];
}

}  // namespace

int process_message(const uint8_t* buffer, int32_t count) {
  // The netlink walk (NLMSG_OK / NLMSG_NEXT), with each header copied out of the buffer so its
  // alignment never matters. bytes_left is signed: a final frame whose alignment bytes are
  // missing makes it negative and so ends the walk.
  int32_t bytes_left = count;
  size_t offset = 0;
  while (bytes_left >= static_cast<int32_t>(sizeof(struct nlmsghdr))) {
    const uint8_t* frame = buffer + offset;
    struct nlmsghdr hdr;
    memcpy(&hdr, frame, sizeof hdr);
    if (hdr.nlmsg_len < sizeof(struct nlmsghdr) ||
        hdr.nlmsg_len > static_cast<uint32_t>(bytes_left)) {
      KLOGE("%s: malformed netlink message\n", "process_message");
      return 0;
    }
    const uint16_t command = hdr.nlmsg_type;
    KLOGI("%s: %d", "process_message", command);
    if (const command_entry* entry = command_entry_of(command)) {
      if (hdr.nlmsg_len < entry->min_frame_length) {
        KLOGE("%s: %s refused: frame of %u bytes, needs %u", "process_message", entry->name,
              hdr.nlmsg_len, entry->min_frame_length);
      } else {
        entry->run(frame);
      }
    }
    const uint32_t step = NLMSG_ALIGN(hdr.nlmsg_len);
    bytes_left -= static_cast<int32_t>(step);
    offset += step;
  }
  return 0;
}
