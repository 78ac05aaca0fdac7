// SPDX-License-Identifier: Apache-2.0
// The tables of kestrelctl: its commands and its options, with their help.
#include <math.h>
#include <stdlib.h>

#include "command_table.h"
#include "handlers.h"
#include "kernel_frame.h"
#include "sensor_names.h"
#include "stream_plot.h"

namespace kestrelctl {
namespace {

using S = Section;

// clang-format off
const std::vector<Command> kCommands = {
    {"status", "<sensor>", S::kReply,
     "command 0; reply frame 0 (did the sensor answer)\n",
     exchange, NETLINK_MESSAGE_GET_STATUS, {}, {FRAME_STATUS}},
    {"selftest", "<sensor>", S::kReply,
     "command 8; reply frame 9 (accel, mag, pressure) or 14 (gyro)\n", selftest},
    // Frame 10, or frame 14 when the gyroscope's last result was a self test.
    {"gyro-temp", "", S::kReply,
     "command 10; reply frame 10 (gyroscope temperature, deg C)\n",
     exchange, NETLINK_MESSAGE_GYRO_TEMPERATURE, {}, {FRAME_GYRO_TEMPERATURE,
                                                      FRAME_GYRO_SELFTEST}},
    {"stream", "<sensor> [--seconds N] [--csv FILE] [--plot FILE]", S::kReply,
     "command 1, then every sample (frame 2) for N seconds\n"
     "(default 5; Ctrl-C stops early), then command 3 and its\n"
     "reply frame 3\n", stream},
    {"mag fuserom", "", S::kReply, "command 11; reply frame 11\n",
     exchange, NETLINK_MESSAGE_MAG_READ_FUSE_ROM, {}, {FRAME_MAG_FUSE_ROM}},
    {"mag registers", "", S::kReply, "command 12; reply frame 12\n",
     exchange, NETLINK_MESSAGE_MAG_READ_REGISTERS, {}, {FRAME_MAG_REGISTERS}},
    // The reply's type follows the filter state the sensor reports, not the command.
    {"lpf on", "", S::kReply, "command 15; reply frame 15 or 16, as the filter is\n",
     exchange, NETLINK_MESSAGE_ACCEL_LPF_ON, {}, {FRAME_ACCEL_LPF_ON, FRAME_ACCEL_LPF_OFF}},
    {"lpf off", "", S::kReply, "command 16; reply frame 15 or 16, as the filter is\n",
     exchange, NETLINK_MESSAGE_ACCEL_LPF_OFF, {}, {FRAME_ACCEL_LPF_ON, FRAME_ACCEL_LPF_OFF}},
    {"dump", "<sensor>", S::kReply, "command 19; reply frame 20 (128 register bytes)\n", dump},
    {"calib read", "<sensor>", S::kReply,
     "command 4; reply frame 5 (calibration from the registry)\n",
     exchange, NETLINK_MESSAGE_READ_CALIB_DATA, {}, {FRAME_CALIBRATION_REPORT}},
    {"calib store", "<sensor> [--flag N]", S::kReply,
     "command 6 with the calibration flag (default 0); reply\n"
     "frame 7\n", calib_store},
    {"bigdata", "<command> <hex>...", S::kReply,
     "bulk data for the light sensor: command 22-26, 28, 29, 31\n"
     "or 32 with sensor_type 4, the length and the bytes (at most\n"
     "256); 28 and 29 wait for frame 30, 31 and 32 for frame 33\n", bigdata},

    {"send", "<command> [word...]", S::kSend,
     "one frame; the words are signed 32-bit, decimal or 0x hex\n", send_words},
    {"raw", "<hex>...", S::kSend, "the bytes as one datagram (spaces allowed)\n", send_raw},
    {"motor on", "", S::kSend, "command 17\n",
     exchange, NETLINK_MESSAGE_ACCEL_MOTOR_ENABLE},
    {"motor off", "", S::kSend, "command 18\n",
     exchange, NETLINK_MESSAGE_ACCEL_MOTOR_DISABLE},
    {"hh set", "<d_factor> <r> <g> <b> <c> <ct> <ct_offset> <th_high> <th_low>", S::kSend,
     "command 35: the light sensor's hidden-hole coefficients\n"
     "(sent with sensor_type 4)\n", hh_set},
    {"hh-perms", "", S::kSend, "command 36: fix the coefficient files' owner and mode\n",
     exchange, NETLINK_MESSAGE_HH_FILE_PERMISSIONS},
    {"diag stop", "", S::kSend, "command 27 with argument 1\n",
     exchange, NETLINK_MESSAGE_DIAG_LOGGING, {0, 1}},
    {"diag dump", "", S::kSend, "command 27 with argument 0\n",
     exchange, NETLINK_MESSAGE_DIAG_LOGGING, {0, 0}},
    {"diag states", "", S::kSend, "command 27 with argument 2\n",
     exchange, NETLINK_MESSAGE_DIAG_LOGGING, {0, 2}},

    {"listen", "[--count N] [--seconds S]", S::kListen,
     "print every frame the daemon sends, until N frames, S\n"
     "seconds or Ctrl-C\n", listen},

    {"decode", "<file> [--csv FILE] [--plot FILE]", S::kCapture,
     "print the protocol 23 frames of a capture (from --pcap, or\n"
     "from tcpdump on a phone's nlmon interface or on any), each\n"
     "with its time stamp (UTC) and direction, told by the sender's\n"
     "port id (20000 is the daemon); packets of other netlink\n"
     "protocols or other link types are skipped and counted. A\n"
     "capture that ends inside a packet, or holds a packet cut\n"
     "short, is exit status 4 after the frames before it.\n", decode_file},
    {"decode --live", "IFACE [--seconds N] [--pcap FILE] [--csv FILE] [--plot FILE]",
     S::kCapture,
     "the same, live from a netlink monitor interface (ip link add\n"
     "nlmon0 type nlmon) or any, until N seconds or Ctrl-C; --pcap\n"
     "keeps what it saw, with the interface's link type\n", decode_live},
};
// clang-format on

double positive_seconds(const std::string& option, const std::string& text) {
  char* end = nullptr;
  const double d = strtod(text.c_str(), &end);
  if (text.empty() || *end != '\0' || !(d > 0.0) || !isfinite(d)) {
    throw UsageError(option + " needs a number of seconds above 0, not '" + text + "'");
  }
  return d;
}

// clang-format off
const std::vector<OptionSpec> kOptions = {
    {"--json", nullptr, Scope::kEverywhere,
     "one JSON object a line for each frame:\n"
     "{\"type\",\"name\",\"len\",\"pid\",\"fields\":{...},\"payload\":\"<hex>\"}\n"
     "and {\"sent\":{...}} for each frame sent\n",
     [](Options* o, const std::string&) { o->json = true; }},
    {"--quiet", nullptr, Scope::kEverywhere,
     "while waiting for a reply, skip the frames that are not the reply (the\n"
     "hidden-hole refresh, frame 34; samples of a stream left running). Without it\n"
     "they are printed, marked [unrelated] (\"unrelated\":true in JSON).\n",
     [](Options* o, const std::string&) { o->quiet = true; }},
    {"--timeout", "SEC", Scope::kEverywhere,
     "how long to wait for a reply. Default: 12 s (the daemon waits up to 8 s for\n"
     "the sensor service before it replies) times KESTREL_TIME_SCALE, at least\n"
     "1 s; bigdata 2 s times KESTREL_TIME_SCALE, at least 1 s.\n",
     [](Options* o, const std::string& v) { o->timeout = positive_seconds("--timeout", v); }},
    {"--pcap", "FILE", Scope::kChannel,
     "write every datagram sent and received, as it passes, to FILE: a pcap\n"
     "capture of netlink protocol 23 (link type NETLINK, as tcpdump writes on\n"
     "nlmon) that tshark and Wireshark open (tools/wireshark/ decodes its fields).\n"
     "An existing capture is appended to, so a session's commands share a file.\n",
     [](Options* o, const std::string& v) { o->pcap = v; }},
    {"--kernel-device", "PATH", Scope::kEverywhere,
     "talk through the factory driver module's device (/dev/kestrel_factory)\n"
     "to a daemon run with KESTREL_NETLINK_PROTOCOL=23 KESTREL_KERNEL_PORT=0\n",
     [](Options*, const std::string& v) { KernelPort::use_device(v); }},
    {"--live", "IFACE", Scope::kOwn, "decode the frames passing a network interface\n",
     [](Options* o, const std::string& v) { o->live = v; }},
    {"--seconds", "N", Scope::kOwn, "how long a stream, a listen or a live decode lasts\n",
     [](Options* o, const std::string& v) { o->seconds = positive_seconds("--seconds", v); }},
    {"--count", "N", Scope::kOwn, "how many frames a listen waits for\n",
     [](Options* o, const std::string& v) {
       int32_t n = 0;
       if (!parse_int32(v, &n) || n <= 0) throw UsageError("--count needs a number above 0");
       o->count = n;
     }},
    {"--flag", "N", Scope::kOwn, "the calibration flag of calib store\n",
     [](Options* o, const std::string& v) {
       int32_t n = 0;
       if (!parse_int32(v, &n)) throw UsageError("--flag needs a 32-bit number");
       o->flag = n;
     }},
    {"--csv", "FILE", Scope::kOwn,
     "the samples of the stream (or of the capture) as CSV: time_s from the first\n"
     "sample, then one column an axis in physical units (x_g, y_g, z_g)\n",
     [](Options* o, const std::string& v) { o->csv = v; }},
    {"--plot", "FILE", Scope::kOwn,
     "the same drawn by gnuplot, PNG or SVG by the file's extension\n",
     [](Options* o, const std::string& v) {
       if (!StreamSamples::is_plot_path(v)) {
         throw UsageError("--plot draws a .png or a .svg file, not '" + v + "'");
       }
       o->plot = v;
     }},
    {"--help", nullptr, Scope::kEverywhere, "this text (also -h)\n",
     [](Options* o, const std::string&) { o->help = true; }},
};
// clang-format on

}  // namespace

const std::vector<Command>& command_table() {
  return kCommands;
}

const std::vector<OptionSpec>& option_table() {
  return kOptions;
}

}  // namespace kestrelctl
