// SPDX-License-Identifier: Apache-2.0
// Writes the seed corpora of the fuzz targets: valid messages, one file each, that start every
// target on the paths a working phone takes.
//
//   make_corpus <dir>    writes <dir>/process_message, <dir>/rcv_test_msg, <dir>/properties and
//                        <dir>/sensor_reg, creating them where needed
//
// process_message: one datagram per command with valid fields (and per sensor where the command
// branches on it), a datagram of several frames, and a few with a failure scenario in the first
// frame's nlmsg_seq. rcv_test_msg: one message per response and indication kind the callback
// reads, and the link events. properties, sensor_reg: sample files.
#include <stdint.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "tools/sim/simulator.h"

namespace {

using bytes = std::vector<uint8_t>;

std::string g_dir;
int g_written = 0;
int g_failed = 0;

void put_u8(bytes* b, uint8_t v) {
  b->push_back(v);
}

void put_u16(bytes* b, uint16_t v) {
  uint8_t p[2];
  memcpy(p, &v, sizeof p);
  b->insert(b->end(), p, p + 2);
}

void put_u32(bytes* b, uint32_t v) {
  uint8_t p[4];
  memcpy(p, &v, sizeof p);
  b->insert(b->end(), p, p + 4);
}

void put_i32(bytes* b, int32_t v) {
  put_u32(b, static_cast<uint32_t>(v));
}

void write_seed(const char* target, const std::string& name, const bytes& b) {
  const std::string path = g_dir + "/" + target + "/" + name;
  FILE* f = fopen(path.c_str(), "wb");
  if (f == nullptr || (!b.empty() && fwrite(b.data(), 1, b.size(), f) != b.size())) {
    fprintf(stderr, "make_corpus: cannot write %s\n", path.c_str());
    if (f != nullptr) fclose(f);
    ++g_failed;
    return;
  }
  fclose(f);
  ++g_written;
}

void write_text(const char* target, const std::string& name, const std::string& text) {
  write_seed(target, name, bytes(text.begin(), text.end()));
}

// ---- process_message: kernel frames ----

// One inbound frame: header, then the payload words, nlmsg_len the frame's aligned length.
bytes frame(uint16_t command, const bytes& payload, uint32_t seq = 0) {
  bytes f;
  const uint32_t len = (16 + static_cast<uint32_t>(payload.size()) + 3) & ~3u;
  put_u32(&f, len);
  put_u16(&f, command);
  put_u16(&f, 0);
  put_u32(&f, seq);
  put_u32(&f, 0);
  f.insert(f.end(), payload.begin(), payload.end());
  f.resize(len, 0);
  return f;
}

bytes words(std::initializer_list<int32_t> values) {
  bytes b;
  for (int32_t v : values) put_i32(&b, v);
  return b;
}

bytes concat(std::initializer_list<bytes> parts) {
  bytes b;
  for (const bytes& p : parts) b.insert(b.end(), p.begin(), p.end());
  return b;
}

void process_message_seeds() {
  const char* t = "process_message";
  char name[64];
  for (int32_t st : {0, 1, 2, 3, 4, 5, 6}) {
    snprintf(name, sizeof name, "cmd00_status_sensor%d", st);
    write_seed(t, name, frame(0, words({st})));
  }
  for (int32_t st : {0, 1, 2, 3, 4, 5}) {
    snprintf(name, sizeof name, "cmd01_raw_data_sensor%d", st);
    write_seed(t, name, frame(1, words({st})));
    snprintf(name, sizeof name, "cmd03_stop_raw_data_sensor%d", st);
    write_seed(t, name, frame(3, words({st})));
  }
  for (int32_t st : {0, 1, 2, 4, 3}) {
    snprintf(name, sizeof name, "cmd04_read_calib_sensor%d", st);
    write_seed(t, name, frame(4, words({st})));
  }
  write_seed(t, "cmd06_store_calib_accel", frame(6, words({0, 1})));
  write_seed(t, "cmd06_store_calib_accel_flag0", frame(6, words({0, 0})));
  write_seed(t, "cmd06_store_calib_mag", frame(6, words({2, 1})));
  write_seed(t, "cmd06_store_calib_light", frame(6, words({4, 1})));
  for (int32_t st : {0, 1, 2, 3, 4, 16}) {
    snprintf(name, sizeof name, "cmd08_selftest_sensor%d", st);
    write_seed(t, name, frame(8, words({st})));
  }
  write_seed(t, "cmd10_gyro_temperature", frame(10, {}));
  write_seed(t, "cmd11_mag_fuse_rom", frame(11, {}));
  write_seed(t, "cmd12_mag_registers", frame(12, {}));
  write_seed(t, "cmd15_accel_lpf_on", frame(15, {}));
  write_seed(t, "cmd16_accel_lpf_off", frame(16, {}));
  write_seed(t, "cmd17_motor_enable", frame(17, {}));
  write_seed(t, "cmd18_motor_disable", frame(18, {}));
  for (int32_t st : {0, 1, 2, 3, 4, 5, 6}) {
    snprintf(name, sizeof name, "cmd19_dump_register_sensor%d", st);
    write_seed(t, name, frame(19, words({st})));
  }
  for (uint16_t c : {22, 23, 24, 25, 26, 28, 29, 31, 32}) {
    snprintf(name, sizeof name, "cmd%02u_bigdata", unsigned{c});
    write_seed(t, name, frame(c, words({4, 8, 0x04030201, 0x08070605})));
  }
  write_seed(t, "cmd24_bigdata_256_bytes", frame(24, concat({words({4, 256}), bytes(256, 0x5a)})));
  write_seed(t, "cmd27_diag_logging_start", frame(27, words({0, 0})));
  write_seed(t, "cmd27_diag_logging_stop", frame(27, words({0, 1})));
  write_seed(t, "cmd35_hidden_hole",
             frame(35, words({4, 1580, 250, 330, 410, 1000, 3300, 1200, 2600, 1800})));
  write_seed(t, "cmd36_hh_file_permissions", frame(36, {}));
  write_seed(t, "cmd02_ignored", frame(2, words({0})));
  write_seed(t, "factory_session",
             concat({frame(0, words({0})), frame(8, words({0})), frame(8, words({1})),
                     frame(4, words({2})), frame(1, words({0})), frame(3, words({0})),
                     frame(19, words({3}))}));
  // Failure scenarios, in the first frame's nlmsg_seq.
  write_seed(t, "scenario_logging_on_cmd27_dump", frame(27, words({0, 0}), 1));
  write_seed(t, "scenario_alloc_fails_selftest", frame(8, words({0}), 1u << 2));
  write_seed(t, "scenario_write_fails_selftest", frame(8, words({0}), 1u << 3));
  write_seed(t, "scenario_write_would_block_status", frame(0, words({0}), 1u << 4));
  write_seed(t, "scenario_test_fails_mag", frame(8, words({2}), 1u << 5));
  write_seed(t, "scenario_test_fails_without_code_lpf", frame(15, {}, 1u << 6));
  write_seed(t, "scenario_no_indications_fuse_rom", frame(11, {}, 1u << 7));
  write_seed(t, "scenario_open_fails_status", frame(0, words({1}), 1u << 8));
  write_seed(t, "scenario_failed_responses_dump", frame(19, words({0}), 1u << 9));
  write_seed(t, "scenario_frame_buffer_fails_selftest", frame(8, words({3}), 4u << 10));
}

// ---- rcv_test_msg: callback messages ----

constexpr uint8_t kHeaderAndBody = 3;
constexpr uint8_t kStateOpen = 1;

bytes callback(int32_t type, uint8_t flags, uint8_t state, uint32_t service, int32_t msg_id,
               uint8_t txn, const bytes& body) {
  bytes b;
  put_i32(&b, type);
  put_u8(&b, flags);
  put_u8(&b, state);
  put_u32(&b, service);
  put_i32(&b, msg_id);
  put_u8(&b, txn);
  b.insert(b.end(), body.begin(), body.end());
  return b;
}

bytes response(uint32_t service, int32_t msg_id, uint8_t txn, const bytes& body) {
  return callback(1, kHeaderAndBody, kStateOpen, service, msg_id, txn, body);
}

bytes indication(uint32_t service, int32_t msg_id, const bytes& body, uint8_t state = kStateOpen) {
  return callback(2, kHeaderAndBody, state, service, msg_id, 0, body);
}

// The phone model's bodies.
using kestrel_sim::sample_indication_body;
using kestrel_sim::test_indication_body;

bytes daf_indication(uint8_t code, uint8_t valid, uint32_t length) {
  return kestrel_sim::daf_indication_body(code, valid, length, {1650, 410, 730, 290, 5200, 62});
}

void rcv_test_msg_seeds() {
  const char* t = "rcv_test_msg";
  bytes state(196, 0);
  const uint8_t ids[] = {0, 10, 20, 30, 40, 60};
  for (size_t i = 0; i < 12; ++i) {
    uint8_t* rec = &state[4 + 16 * i];
    rec[0] = i < sizeof ids ? ids[i] : 255;
    if (i < sizeof ids) {
      rec[1] = 1;
      rec[3] = 0x0a;
      rec[4] = 0x64;
      rec[12] = 1;
    }
  }
  write_seed(t, "resp_sensor_state", response(0, 64, 0, state));
  write_seed(t, "resp_cal_reset", response(0, 38, 4, {0, 0, 0}));
  bytes report(12, 0);
  report[8] = 20;
  write_seed(t, "resp_report", response(0, 2, 2, report));
  write_seed(t, "resp_test", response(0, 13, 4, {0, 0}));
  write_seed(t, "resp_status", response(0, 11, 6, {0, 0, 0}));
  write_seed(t, "resp_error", response(0, 13, 4, {1, 3}));
  write_seed(t, "resp_register_read_service", response(13, 5, 0, {0, 0}));
  bytes daf(140, 0);
  const int32_t high = 2600, low = 1800, hd_high = 3100, hd_low = 2300;
  memcpy(&daf[12], &high, 4);
  memcpy(&daf[16], &low, 4);
  memcpy(&daf[20], &hd_high, 4);
  memcpy(&daf[24], &hd_low, 4);
  write_seed(t, "resp_daf_threshold", response(44, 32, 167, daf));
  write_seed(t, "resp_daf_hd_threshold", response(44, 32, 168, daf));
  bytes dump(140, 0);
  for (size_t i = 0; i < 128; ++i) dump[12 + i] = static_cast<uint8_t>(i);
  write_seed(t, "resp_daf_register_dump_accel", response(44, 32, 169, dump));
  write_seed(t, "resp_daf_register_dump_light_upper", response(44, 32, 174, dump));
  write_seed(t, "resp_daf_plain", response(44, 32, 123, {0, 0}));
  write_seed(t, "resp_daf_error", response(44, 32, 7, {1, 5}));

  write_seed(
      t, "ind_test_accel_passed",
      indication(0, 13, test_indication_body(0, 6, 0, 0, 0, {1, 9, -14, 1010, 1, 298, -301, 402})));
  write_seed(
      t, "ind_test_gyro_passed",
      indication(0, 13,
                 test_indication_body(10, 6, 0, 0, 0,
                                      {1, 1, 1320, -790, 455, 1, 10, -7, 3, 398, -405, 441})));
  write_seed(t, "ind_test_gyro_temperature",
             indication(0, 13, test_indication_body(10, 13, 0, 0, 0, {2, 1835008})));
  write_seed(t, "ind_test_mag_fuse_rom_failed",
             indication(0, 13, test_indication_body(20, 10, 1, 1, 7, {0x48, 0x09, 0x01})));
  write_seed(t, "ind_test_mag_selftest_failed_without_code",
             indication(0, 13, test_indication_body(20, 6, 1, 0, 0, {1, 0, -28, 17, -690})));
  write_seed(t, "ind_test_pressure_passed",
             indication(0, 13, test_indication_body(30, 6, 0, 0, 0, {1, 101280})));
  write_seed(t, "ind_test_unknown_sensor",
             indication(0, 13, test_indication_body(40, 3, 0, 0, 0, {})));
  write_seed(t, "ind_sample_accel",
             indication(0, 3, sample_indication_body(0, 0, 6553, -13107, 642252)));
  write_seed(t, "ind_sample_gyro", indication(0, 3, sample_indication_body(10, 0, 1200, -800, 40)));
  write_seed(t, "ind_sample_mag_sensitivity_set",
             indication(0, 3, sample_indication_body(20, 0, 2000, -3000, 4000), kStateOpen | 8));
  write_seed(t, "ind_sample_mag_sensitivity_zero",
             indication(0, 3, sample_indication_body(20, 0, 2000, 0, -1)));
  write_seed(t, "ind_sample_pressure", indication(0, 3, sample_indication_body(30, 0, 1, 2, 3)));
  write_seed(t, "ind_sample_light", indication(0, 3, sample_indication_body(40, 0, 65536, 0, 0)));
  write_seed(t, "ind_sample_sensor60",
             indication(0, 3, sample_indication_body(60, 0, 70000, -70000, 5)));
  write_seed(t, "ind_sample_secondary",
             indication(0, 3, sample_indication_body(0, 1, 65536, 131072, -65536)));
  write_seed(t, "ind_daf_als_rgb", indication(44, 33, daf_indication(61, 1, 24)));
  write_seed(t, "ind_daf_short", indication(44, 33, daf_indication(51, 1, 8)));
  write_seed(t, "ind_daf_als_rgb_invalid", indication(44, 33, daf_indication(61, 0, 24)));
  write_seed(t, "ind_daf_short_too_short", indication(44, 33, daf_indication(51, 1, 4)));

  // Link events: a broken pipe with logging on (and the reopen allowed), one whose reopen fails,
  // one with logging forbidden by the debug level; retry open; an unknown type; no header.
  write_seed(t, "link_broken_pipe", callback(250, 1, kStateOpen | 2, 0, 0, 0, {}));
  write_seed(t, "link_broken_pipe_reopen_fails", callback(250, 1, kStateOpen | 16, 0, 0, 0, {}));
  write_seed(t, "link_broken_pipe_logging_forbidden",
             callback(250, 1, kStateOpen | 32, 0, 0, 0, {}));
  write_seed(t, "link_retry_open", callback(251, 1, kStateOpen, 0, 0, 0, {}));
  write_seed(t, "unknown_type", callback(7, kHeaderAndBody, kStateOpen, 0, 13, 0, {1, 2, 3}));
  write_seed(t, "null_header", callback(1, 2, kStateOpen, 0, 64, 0, {0, 0}));
}

// ---- properties and sensor_reg: sample files ----

void property_seeds() {
  const char* t = "properties";
  write_text(t, "normal",
             "# a phone on the factory line\npersist.sys.usb.q_config=mtp,adb\n"
             "ro.debug_level=0x494d\n");
  write_text(t, "diag_mode", "persist.sys.usb.q_config=diag,serial_cdev,rmnet,adb\n");
  write_text(t, "debug_level_forbids", "ro.debug_level=0x4f4c\n");
  write_text(t, "crlf_and_comments",
             "#persist.sys.usb.q_config=diag\r\n\r\npersist.sys.usb.q_config=mtp\r\n"
             "ro.debug_level=0x494d\r\n");
  write_text(t, "long_value", "ro.debug_level=" + std::string(120, 'x') + "\n");
  write_text(t, "first_match_wins", "ro.debug_level=0x4f4c\nro.debug_level=0x494d\n");
  write_text(t, "no_newline", "ro.debug_level=0x4f4c");
}

void registry_seeds() {
  const char* t = "sensor_reg";
  write_text(t, "calibrated",
             "# accelerometer\n0 = 03\n1 = fe\n2 = 12\n"
             "# gyroscope\n300 = 01\n301 = 00\n302 = fd\n"
             "# magnetometer soft iron\n406 = 4a 27 00 00\n407 = 9c ff ff ff\n408 = 0c 00 00 00\n"
             "409 = a0 ff ff ff\n410 = e2 26 00 00\n411 = 1e 00 00 00\n412 = f6 ff ff ff\n"
             "413 = 28 00 00 00\n414 = 35 27 00 00\n"
             "# light sensor\n102 = 2c 01\n119 = 20 03\n120 = 58 02\n123 = 01\n"
             "124 = 0e 00 00 00\n125 = b8 0b\n126 = d0 07\n");
  write_text(t, "faults",
             "open_failures = 2\nread_error 119 = 5\nclose_result = 7\n0 = 01\n1 =\n2 = 0\n");
  write_text(t, "packed_and_comments",
             "406 = 4a270000 # packed\n  407=9cffffff\n408 = 0c 00 00 00 # trailing\n"
             "bogus line\n409 = zz\n");
  write_text(t, "uncalibrated_accel", "0 = 00\n1 = 00\n2 = 00\n");
  // A read that reports success and hands over no data.
  write_text(t, "read_succeeds_without_data",
             "0 = 03\n1 = fe\nread_error 2 = 0\n406 = 4a 27 00 00\nread_error 407 = 0\n");
  std::string long_item = "125 =";
  for (int i = 0; i < 255; ++i) long_item += " ab";
  write_text(t, "longest_item", long_item + "\n");
  write_text(t, "open_never_succeeds", "open_failures = 1000\n0 = 01\n");
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    fprintf(stderr, "usage: %s <corpus directory>\n", argv[0]);
    return 2;
  }
  g_dir = argv[1];
  mkdir(g_dir.c_str(), 0755);
  for (const char* target : {"process_message", "rcv_test_msg", "properties", "sensor_reg"}) {
    mkdir((g_dir + "/" + target).c_str(), 0755);
  }
  process_message_seeds();
  rcv_test_msg_seeds();
  property_seeds();
  registry_seeds();
  printf("%d seeds written under %s\n", g_written, g_dir.c_str());
  return g_failed == 0 ? 0 : 1;
}
