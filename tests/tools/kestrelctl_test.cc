// SPDX-License-Identifier: Apache-2.0
// kestrelctl's library: command frames byte for byte, the decoding of every frame type the
// daemon sends (text and JSON), the parsing of sensors and numbers, and the help of the tables.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

#include "command_table.h"
#include "daemon_frames.h"
#include "frame_codec.h"
#include "frame_decoder.h"
#include "sensor_names.h"

namespace kestrelctl {
namespace {

DecodedFrame decode(uint16_t type, const Bytes& payload) {
  const Bytes d = daemon_frame(type, payload);
  return decode_frame(split_frames(d.data(), d.size()).at(0));
}

TEST(KestrelctlFrames, CommandFramesAreByteExact) {
  EXPECT_EQ(to_hex(build_command(8, {0})), "1400000008000000000000000000000000000000");
  EXPECT_EQ(to_hex(build_command(27, {-2, 0x01020304})),
            "180000001b0000000000000000000000feffffff04030201");
  // Hidden-hole coefficients: sensor_type 4, then the nine values from frame offset 20 on.
  EXPECT_EQ(to_hex(build_hidden_hole({1, 2, 3, 4, 5, 6, 7, 8, -9})),
            "380000002300000000000000000000000400000001000000020000000300000004000000"
            "05000000060000000700000008000000f7ffffff");
  // Bulk data: nlmsg_len counts header, sensor_type, length and data, not the alignment.
  EXPECT_EQ(to_hex(build_bigdata(32, 4, {1, 2, 3, 4})),
            "1c000000200000000000000000000000040000000400000001020304");
  EXPECT_EQ(to_hex(build_bigdata(22, 4, {0xab})),
            "190000001600000000000000000000000400000001000000ab000000");
}

TEST(KestrelctlFrames, SplitWalksAlignedFramesAndFlagsMalformedOnes) {
  Bytes d = daemon_frame(34, {4, 1});  // nlmsg_len 20 with two alignment bytes, then a status
  d[0] = 18;
  const Bytes status = daemon_frame(0, {3, 1});
  d.insert(d.end(), status.begin(), status.end());
  const std::vector<Frame> frames = split_frames(d.data(), d.size());
  ASSERT_EQ(frames.size(), 2u);
  EXPECT_EQ(frames[0].payload, (Bytes{4, 1}));
  EXPECT_EQ(frames[1].payload, (Bytes{3, 1, 0, 0}));

  Bytes long_len = daemon_frame(9, {1, 2, 3, 4});  // nlmsg_len beyond the datagram
  long_len[0] = 200;
  EXPECT_EQ(decode_frame(split_frames(long_len.data(), long_len.size()).at(0)).problem,
            "nlmsg_len 200 is beyond the 20 bytes left in the datagram");
  EXPECT_EQ(decode_frame(split_frames(long_len.data(), 3).at(0)).problem,
            "a datagram of 3 bytes is shorter than a frame header");
}

// Every frame type the daemon sends, and its text.
TEST(KestrelctlDecode, EveryFrameTypeReadsAsText) {
  Bytes dump = {5};  // index 5, then registers holding 0 to 127
  for (uint8_t i = 0; i < 128; ++i) dump.push_back(i);
  const std::tuple<uint16_t, Bytes, std::string> cases[] = {
      // clang-format off
      {0, {6, 0}, "type 0 (status)  len 20  pid 20000\n  sensor_type       6 (sensor 60)\n"
       "  no_response       0 (the sensor answered)\n"},
      // x 2048, y -4096, z 417, then three values of 9.
      {2, words({0, int32_t(0xf0000800), 0x000901a1, 0x00090009}),
       "type 2 (sample)  len 32  pid 20000  code 0 (accel)  "
       "values x=2048 y=-4096 z=417 (0.500 -1.000 0.102 g)\n"},
      {2, words({1, int32_t(0xffba0046), 14, 0}), "type 2 (sample)  len 32  pid 20000  code 1 "
       "(gyro)  values x=70 y=-70 z=14 (1.00 -1.00 0.20 \u00b0/s)\n"},
      {3, words({5, 0}), "type 3 (stop)  len 24  pid 20000\n  code              5 (light)\n"},
      // The magnetometer's words in hex.
      {5, words({2, 0x04030201, -1, 0, 0, 0, 0, 0, 0, 9, 0}),
       "type 5 (calibration_report)  len 60  pid 20000\n  pdata_sensor_type 2 (mag)\n"
       "  words             0x04030201 0xffffffff 0x00000000 0x00000000 0x00000000 0x00000000 "
       "0x00000000 0x00000000 0x00000009\n  result            0 (read)\n"},
      {7, words({2, 1}), "type 7 (store_calibration)  len 24  pid 20000\n"
       "  pdata_sensor_type 2 (mag)\n"
       "  result            1 (no completion within the daemon's wait)\n"},
      // Frame words 1 to 8 carry accel_result 0, 4 to 7, then 1 to 3.
      {9, words({0, 10, 14, 15, 16, 17, 11, 12, 13, 0, 0, 0, 0, 0, 0, 0, 0, 0}),
       "type 9 (selftest)  len 88  pid 20000\n  sensor_type       0 (accel)\n"
       "  result            10 (FAIL)\n  accel_result[4]   14\n  accel_result[5]   15\n"
       "  accel_result[6]   16\n  accel_result[7]   17\n  accel_result[1]   11\n"
       "  accel_result[2]   12\n  accel_result[3]   13\n"},
      {10, words({11, -1, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}),
       "type 10 (gyro_temperature)  len 76  pid 20000\n  code              11 (temperature)\n"
       "  temperature_c     -1 \u00b0C\n"},
      {11, words({2, 64, -128, 0, 0, 0, 0, 0, -1}), "type 11 (mag_fuse_rom)  len 52  pid 20000\n"
       "  code              2 (mag)\n  fuse_rom          64 -128 0 (sensitivity 1.5 0 1)\n"
       "  result            -1 (no outcome)\n"},
      {12, words({2, 0, 0, 0, 0x020109ff, 0x06050403, 0x0a090807, 0x800b, 1}),
       "type 12 (mag_registers)  len 52  pid 20000\n  code              2 (mag)\n"
       "  registers         ff 09 01 02 03 04 05 06 07 08 09 0a 0b 80\n"
       "  result            1 (failed with an error code)\n"},
      {14, words({1, 0, 102, 103, 104, 105, 106, 107, 108, 109, 110, 111, 112, 113, 114}),
       "type 14 (gyro_selftest)  len 76  pid 20000\n  test_type         1 (self test)\n"
       "  result            0 (FAIL, g1)\n  g5                102 (g5)\n"
       "  offset_x          103 (g2 / 1000)\n  offset_y          104 (g3 / 1000)\n"
       "  offset_z          105 (g4 / 1000)\n  nost_x            106 (g6)\n"
       "  nost_y            107 (g7)\n  nost_z            108 (g8)\n"
       "  st_x              109 (g9)\n  st_y              110 (g10)\n"
       "  st_z              111 (g11)\n  diff_x            112 (|g9 - g6|)\n"
       "  diff_y            113 (|g10 - g7|)\n  diff_z            114 (|g11 - g8|)\n"},
      {15, words({12, 0, 1}), "type 15 (lpf_on)  len 28  pid 20000\n"
       "  code              12 (filter on)\n  lpf_on_off        1\n"},
      {16, words({13, 0, 0}), "type 16 (lpf_off)  len 28  pid 20000\n"
       "  code              13 (filter off)\n  lpf_on_off        0\n"},
      {20, dump, "type 20 (register_dump)  len 148  pid 20000\n"
       "  index             5 (light-short)\n  registers         0x80-0xff\n"
       "           00 01 02 03 04 05 06 07 08 09 0a 0b 0c 0d 0e 0f\n"
       "      0x80 00 01 02 03 04 05 06 07 08 09 0a 0b 0c 0d 0e 0f\n"
       "      0x90 10 11 12 13 14 15 16 17 18 19 1a 1b 1c 1d 1e 1f\n"
       "      0xa0 20 21 22 23 24 25 26 27 28 29 2a 2b 2c 2d 2e 2f\n"
       "      0xb0 30 31 32 33 34 35 36 37 38 39 3a 3b 3c 3d 3e 3f\n"
       "      0xc0 40 41 42 43 44 45 46 47 48 49 4a 4b 4c 4d 4e 4f\n"
       "      0xd0 50 51 52 53 54 55 56 57 58 59 5a 5b 5c 5d 5e 5f\n"
       "      0xe0 60 61 62 63 64 65 66 67 68 69 6a 6b 6c 6d 6e 6f\n"
       "      0xf0 70 71 72 73 74 75 76 77 78 79 7a 7b 7c 7d 7e 7f\n"},
      // Each threshold frame fills only its own pair of words.
      {30, words({5, -3, 77, 88}), "type 30 (threshold)  len 32  pid 20000\n"
       "  high              5\n  low               -3\n"},
      {33, words({77, 88, 7, -9}), "type 33 (hd_threshold)  len 32  pid 20000\n"
       "  hd_high           7\n  hd_low            -9\n"},
      {34, {4, 1}, "type 34 (hh_refresh)  len 20  pid 20000\n"
       "  value             260 (refresh the light-sensor coefficients)\n"},
      // Unknown types and short payloads: the bytes only, with the reason for the latter.
      {21, {0xde, 0xad}, "type 21 (unknown)  len 20  pid 20000\n"
       "  payload           de ad 00 00\n"},
      {9, words({0, 1}), "type 9 (selftest)  len 24  pid 20000\n"
       "  problem: a payload of 8 bytes is shorter than the 72 bytes of its layout\n"
       "  payload           00 00 00 00 01 00 00 00\n"},
      // clang-format on
  };
  for (const auto& [type, data, text] : cases) EXPECT_EQ(format_text(decode(type, data)), text);
}

// The JSON form: the header, the fields (self-test words in the sensor's order) and the payload.
TEST(KestrelctlDecode, JsonCarriesHeaderFieldsPayloadAndMarks) {
  // -1 is the daemon's mark of a failed magnetometer test; mag_result words 2 to 9 come from
  // frame words 9 to 16.
  const Bytes mag = words({2, -1, 21, 0, 0, 0, 0, 0, 0, 22, 23, 24, 25, 26, 27, 28, 29, 99});
  EXPECT_EQ(format_json(decode(9, mag), true),
            "{\"type\":9,\"name\":\"selftest\",\"len\":88,\"pid\":20000,\"fields\":{"
            "\"sensor_type\":2,\"sensor\":\"mag\",\"result\":-1,\"verdict\":\"FAIL\","
            "\"mag_result\":[-1,21,22,23,24,25,26,27,28,29]},\"payload\":\"" +
                to_hex(mag) + "\",\"unrelated\":true}");
  EXPECT_THAT(
      format_json(decode(9, words({0, 1, 5, 6, 7, 8, 2, 3, 4, 0, 0, 0, 0, 0, 0, 0, 0, 0}))),
      testing::HasSubstr("\"result\":1,\"verdict\":\"PASS\",\"accel_result\":[1,2,3,4,5,6,7,8]}"));
  EXPECT_EQ(json_string("a\"b\\c\nd\x01"), "\"a\\\"b\\\\c\\nd\\u0001\"");
  Bytes bigdata = build_bigdata(24, 4, {1, 2});  // captured with a length beyond its data
  store_i32(bigdata.data(), 20, 9);
  EXPECT_EQ(
      format_json(decode_command(split_frames(bigdata.data(), bigdata.size()).at(0))),
      "{\"command\":24,\"name\":\"bigdata\",\"len\":26,\"pid\":0,\"fields\":{\"sensor_type\":4,"
      "\"length\":9},\"payload\":\"04000000090000000102\",\"problem\":\"a length of 9 is beyond "
      "the 2 data bytes of the frame\"}");
}

TEST(KestrelctlParse, NumbersAndSensors) {
  int32_t v = 0;
  // clang-format off
  const std::pair<const char*, int32_t> good[] = {
      {"-2147483648", INT32_MIN}, {"0xffffffff", -1}, {"0X1f", 31}, {"+7", 7}, {"accel", 0},
      {"gyroscope", 1}, {"mag", 2}, {"pressure", 3}, {"light", 4}, {"light-short", 5}, {"16", 16}};
  // clang-format on
  for (const auto& [text, value] : good) EXPECT_TRUE(parse_sensor(text, &v) && v == value) << text;
  const char* bad[] = {"",    "-",   "0x",          "2147483648", "0x100000000",
                       "12a", "1.5", "-0x80000001", "Accel",      "light-"};
  for (const char* text : bad) EXPECT_FALSE(parse_sensor(text, &v)) << text;
  EXPECT_EQ(sensor_type_name(8), "mag");
  EXPECT_EQ(sensor_type_name(-1), "no sensor");
}

// The help shows every command's usage line and every option, each on a line of its own.
TEST(KestrelctlHelp, ShowsEveryCommandAndOption) {
  const std::string help = help_text();
  std::vector<std::string> labels;
  for (const Command& c : command_table()) labels.push_back(c.usage());
  for (const OptionSpec& o : option_table()) labels.push_back(o.name);
  for (const std::string& label : labels) {
    const size_t at = help.find("\n  " + label);
    ASSERT_NE(at, std::string::npos) << label;
    EXPECT_THAT(help.substr(at + 3 + label.size(), 1), testing::AnyOf(" ", "\n")) << label;
  }
}

}  // namespace
}  // namespace kestrelctl
