// SPDX-License-Identifier: Apache-2.0
// The commands that send one frame to the daemon and, for most, wait for its reply.
#include <array>
#include <set>

#include "handlers.h"
#include "kernel_frame.h"
#include "kernel_sensors.h"
#include "sensor_names.h"

namespace kestrelctl {
namespace {

constexpr double kBigdataTimeoutSeconds = 2.0;
constexpr size_t kBigdataMaxBytes = 256;

// A command the daemon does not answer: sent, with a note on why no reply comes.
int send_unanswered(Session& session, const std::vector<uint8_t>& frame, const char* why) {
  const int r = session.send_only(frame);
  if (r == kExitOk) session.note(std::string("no reply expected: ") + why);
  return r;
}

// The bytes of the arguments, written as hex with or without spaces.
std::vector<uint8_t> hex_arguments(const Session& session, size_t first, const char* what) {
  std::string hex;
  for (size_t i = first; i < session.arguments().size(); ++i) hex += session.arguments()[i] + " ";
  std::vector<uint8_t> bytes;
  std::string error;
  if (!parse_hex(hex, &bytes, &error)) throw UsageError(what + error);
  return bytes;
}

}  // namespace

int exchange(Session& session, const Command& command) {
  std::vector<int32_t> words = command.words;
  for (const std::string& sensor : session.arguments()) words.push_back(sensor_argument(sensor));
  const std::vector<uint8_t> frame = build_command(command.number, words);
  if (command.replies.empty()) return session.send_only(frame);
  return session.send_and_wait(frame, {command.replies.begin(), command.replies.end()},
                               session.reply_timeout());
}

int selftest(Session& session, const Command&) {
  const int32_t sensor_type = sensor_argument(session.arguments()[0]);
  const std::vector<uint8_t> frame = build_command(NETLINK_MESSAGE_SELFTEST, {sensor_type});
  const int32_t id = smgr_id_by_sensor_type(sensor_type);
  const double timeout = session.reply_timeout();
  // The gyroscope's reply is frame 14, or frame 10 when its last result was a temperature.
  if (id == kSmgrGyro) {
    return session.send_and_wait(frame, {FRAME_GYRO_SELFTEST, FRAME_GYRO_TEMPERATURE}, timeout);
  }
  if (id == kSmgrAccel || id == kSmgrMag || id == kSmgrPressure) {
    return session.send_and_wait(frame, {FRAME_SELFTEST}, timeout);
  }
  return send_unanswered(session, frame,
                         "the daemon replies to self tests of the accel, gyro, mag and pressure "
                         "sensor types only");
}

int dump(Session& session, const Command&) {
  const int32_t sensor_type = sensor_argument(session.arguments()[0]);
  const std::vector<uint8_t> frame = build_command(NETLINK_MESSAGE_DUMP_REGISTER, {sensor_type});
  if (sensor_type < 0 || sensor_type > kLastDumpSensorType) {
    return send_unanswered(session, frame,
                           "the daemon dumps the registers of sensor types 0 to 5 only");
  }
  // A dump comes back with the sensor_type it was asked for as its index.
  return session.send_and_wait(
      frame, {FRAME_REGISTER_DUMP}, session.reply_timeout(),
      [sensor_type](const Frame& f) { return !f.payload.empty() && f.payload[0] == sensor_type; });
}

int calib_store(Session& session, const Command&) {
  const int32_t sensor_type = sensor_argument(session.arguments()[0]);
  return session.send_and_wait(build_command(NETLINK_MESSAGE_STORE_CALIB_DATA,
                                             {sensor_type, session.options().flag.value_or(0)}),
                               {FRAME_STORE_CALIBRATION}, session.reply_timeout());
}

int bigdata(Session& session, const Command&) {
  const std::string& number = session.arguments()[0];
  const int32_t command = number_argument("command", number);
  const bigdata_kind* kind =
      command < 0 ? nullptr : bigdata_kind_of(static_cast<uint32_t>(command));
  if (kind == nullptr) {
    throw UsageError("command " + number +
                     " is no bulk-data command: use 22 to 26, 28, 29, 31 or 32");
  }
  const std::vector<uint8_t> data = hex_arguments(session, 1, "bulk data: ");
  if (data.size() > kBigdataMaxBytes) {
    throw UsageError("bulk data of " + std::to_string(data.size()) +
                     " bytes: the driver takes at most 256 (send anything else with raw)");
  }
  const std::vector<uint8_t> frame = build_bigdata(kind->command, SENSOR_TYPE_LIGHT, data);
  if (kind->reply_frame < 0) return session.send_only(frame);
  return session.send_and_wait(frame, {static_cast<uint16_t>(kind->reply_frame)},
                               session.reply_timeout(kBigdataTimeoutSeconds));
}

int send_words(Session& session, const Command&) {
  const std::vector<std::string>& args = session.arguments();
  const int32_t number = number_argument("command", args[0]);
  if (number < 0 || number > 0xffff) {
    throw UsageError("command " + args[0] + " does not fit the 16-bit nlmsg_type");
  }
  std::vector<int32_t> words;
  for (size_t i = 1; i < args.size(); ++i) words.push_back(number_argument("word", args[i]));
  return session.send_only(build_command(static_cast<uint16_t>(number), words));
}

int send_raw(Session& session, const Command&) {
  const std::vector<uint8_t> bytes = hex_arguments(session, 0, "raw: ");
  if (bytes.empty()) session.usage_error();
  return session.send_only(bytes, true);
}

int hh_set(Session& session, const Command&) {
  static const char* const kNames[9] = {"d_factor", "r",         "g",       "b",     "c",
                                        "ct",       "ct_offset", "th_high", "th_low"};
  std::array<int32_t, 9> coefficients;
  for (size_t i = 0; i < 9; ++i) {
    coefficients[i] = number_argument(kNames[i], session.arguments()[i]);
  }
  return session.send_only(build_hidden_hole(coefficients));
}

}  // namespace kestrelctl
