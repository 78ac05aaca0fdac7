// kestrelctl's library: command frames byte for byte, the decoding of every frame type the
// daemon sends (text and JSON), and the parsing of sensors, numbers and hex.
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <vector>

#include "frame_codec.h"
#include "frame_decoder.h"
#include "sensor_names.h"

namespace kestrelctl {
namespace {

std::vector<uint8_t> le_words(const std::vector<int32_t>& words) {
  std::vector<uint8_t> bytes(words.size() * 4);
  if (!words.empty()) memcpy(bytes.data(), words.data(), bytes.size());
  return bytes;
}

// A datagram as the daemon sends it: nlmsg_len counts the alignment bytes, pid 20000.
std::vector<uint8_t> daemon_datagram(uint16_t type, const std::vector<uint8_t>& payload) {
  const uint32_t len = static_cast<uint32_t>(16 + ((payload.size() + 3) & ~size_t{3}));
  const uint32_t pid = 20000;
  std::vector<uint8_t> d(len, 0);
  memcpy(d.data(), &len, 4);
  memcpy(d.data() + 4, &type, 2);
  memcpy(d.data() + 12, &pid, 4);
  if (!payload.empty()) memcpy(d.data() + 16, payload.data(), payload.size());
  return d;
}

DecodedFrame decode(uint16_t type, const std::vector<uint8_t>& payload) {
  const std::vector<uint8_t> d = daemon_datagram(type, payload);
  const std::vector<Frame> frames = split_frames(d.data(), d.size());
  EXPECT_EQ(frames.size(), 1u);
  return decode_frame(frames.at(0));
}

std::string text(uint16_t type, const std::vector<uint8_t>& payload) {
  return format_text(decode(type, payload));
}

// The "fields" object of the JSON form.
std::string json_fields(uint16_t type, const std::vector<uint8_t>& payload) {
  const std::string json = format_json(decode(type, payload));
  const size_t begin = json.find("\"fields\":");
  const size_t end = json.find(",\"payload\":");
  return json.substr(begin + 9, end - begin - 9);
}

TEST(KestrelctlFrames, CommandFramesAreByteExact) {
  EXPECT_EQ(to_hex(build_command(8, {0})), "1400000008000000000000000000000000000000");
  EXPECT_EQ(to_hex(build_command(36)), "10000000240000000000000000000000");
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
  EXPECT_EQ(to_hex(build_bigdata(28, 4, {})), "180000001c00000000000000000000000400000000000000");
  EXPECT_EQ(build_bigdata(29, 4, std::vector<uint8_t>(256, 7)).size(), 280u);
}

TEST(KestrelctlFrames, SplitWalksAlignedFramesAndFlagsMalformedOnes) {
  // A 2-byte payload frame (nlmsg_len 18, two alignment bytes) followed by a status frame.
  std::vector<uint8_t> d = {18, 0, 0, 0, 34, 0, 0, 0, 0, 0, 0, 0, 0x20, 0x4e, 0, 0, 4, 1, 0, 0};
  const std::vector<uint8_t> status = daemon_datagram(0, {3, 1});
  d.resize(40);
  memcpy(d.data() + 20, status.data(), status.size());
  std::vector<Frame> frames = split_frames(d.data(), d.size());
  ASSERT_EQ(frames.size(), 2u);
  EXPECT_EQ(frames[0].type, 34);
  EXPECT_EQ(frames[0].payload, (std::vector<uint8_t>{4, 1}));
  EXPECT_EQ(frames[1].type, 0);
  EXPECT_EQ(frames[1].pid, 20000u);
  EXPECT_FALSE(frames[1].malformed);

  // nlmsg_len beyond the datagram: one malformed frame holding every byte.
  std::vector<uint8_t> long_len = daemon_datagram(9, {1, 2, 3, 4});
  long_len[0] = 200;
  frames = split_frames(long_len.data(), long_len.size());
  ASSERT_EQ(frames.size(), 1u);
  EXPECT_TRUE(frames[0].malformed);
  EXPECT_EQ(frames[0].payload, long_len);
  EXPECT_EQ(format_text(decode_frame(frames[0])),
            "type 9 (malformed)  len 200  pid 20000\n"
            "  problem: nlmsg_len 200 is beyond the 20 bytes left in the datagram\n"
            "  payload           c8 00 00 00 09 00 00 00 00 00 00 00 20 4e 00 00 01 02 03 04\n");

  const uint8_t tiny[3] = {1, 2, 3};
  frames = split_frames(tiny, sizeof tiny);
  ASSERT_EQ(frames.size(), 1u);
  EXPECT_EQ(decode_frame(frames[0]).problem,
            "a datagram of 3 bytes is shorter than a frame header");
}

TEST(KestrelctlDecode, SelftestAccelKeepsTheDriversWordOrder) {
  // Frame words 1..8 carry accel_result 0, 4, 5, 6, 7, 1, 2, 3.
  std::vector<int32_t> words(18, 0);
  const int32_t carried[8] = {10, 14, 15, 16, 17, 11, 12, 13};
  for (int i = 0; i < 8; ++i) words[i + 1] = carried[i];
  const std::vector<uint8_t> payload = le_words(words);
  EXPECT_EQ(text(9, payload),
            "type 9 (selftest)  len 88  pid 20000\n"
            "  sensor_type       0 (accel)\n"
            "  result            10 (FAIL)\n"
            "  accel_result[4]   14\n"
            "  accel_result[5]   15\n"
            "  accel_result[6]   16\n"
            "  accel_result[7]   17\n"
            "  accel_result[1]   11\n"
            "  accel_result[2]   12\n"
            "  accel_result[3]   13\n");
  EXPECT_EQ(json_fields(9, payload),
            "{\"sensor_type\":0,\"sensor\":\"accel\",\"result\":10,\"verdict\":\"FAIL\","
            "\"accel_result\":[10,11,12,13,14,15,16,17]}");
}

TEST(KestrelctlDecode, SelftestMagAndPressure) {
  std::vector<int32_t> mag(18, 0);
  mag[0] = 2;
  mag[1] = -1;  // the daemon's mark of a failed magnetometer test
  mag[2] = 21;
  for (int i = 9; i <= 16; ++i) mag[i] = i + 13;  // mag_result words 2..9 = 22..29
  mag[17] = 99;                                   // not a mag_result word
  EXPECT_EQ(json_fields(9, le_words(mag)),
            "{\"sensor_type\":2,\"sensor\":\"mag\",\"result\":-1,\"verdict\":\"FAIL\","
            "\"mag_result\":[-1,21,22,23,24,25,26,27,28,29]}");
  // The frame carries hPa already truncated by the daemon; shown as carried.
  std::vector<int32_t> pressure(18, 0);
  pressure[0] = 3;
  pressure[1] = 1;
  pressure[2] = -1;
  EXPECT_EQ(text(9, le_words(pressure)),
            "type 9 (selftest)  len 88  pid 20000\n"
            "  sensor_type       3 (pressure)\n"
            "  result            1 (PASS)\n"
            "  pressure_hpa      -1 hPa\n");
  pressure[2] = 1013;
  EXPECT_EQ(json_fields(9, le_words(pressure)),
            "{\"sensor_type\":3,\"sensor\":\"pressure\",\"result\":1,\"verdict\":\"PASS\","
            "\"pressure_hpa\":1013}");

  std::vector<int32_t> other(18, 0);
  other[0] = 7;
  other[17] = -5;
  EXPECT_EQ(json_fields(9, le_words(other)),
            "{\"sensor_type\":7,\"sensor\":\"no sensor\","
            "\"words\":[7,0,0,0,0,0,0,0,0,0,0,0,0,0,0,0,0,-5]}");
}

TEST(KestrelctlDecode, GyroSelftestNamesEveryWordAndTemperatureIsInDegrees) {
  std::vector<int32_t> g;
  for (int i = 0; i < 15; ++i) g.push_back(100 + i);
  g[0] = 1;
  g[1] = 0;
  EXPECT_EQ(json_fields(14, le_words(g)),
            "{\"test_type\":1,\"result\":0,\"verdict\":\"FAIL\",\"g5\":102,\"offset_x\":103,"
            "\"offset_y\":104,\"offset_z\":105,\"nost_x\":106,\"nost_y\":107,\"nost_z\":108,"
            "\"st_x\":109,\"st_y\":110,\"st_z\":111,\"diff_x\":112,\"diff_y\":113,"
            "\"diff_z\":114}");

  std::vector<int32_t> temperature(15, 0);
  temperature[0] = 11;
  temperature[1] = -1;
  EXPECT_EQ(text(10, le_words(temperature)),
            "type 10 (gyro_temperature)  len 76  pid 20000\n"
            "  code              11 (temperature)\n"
            "  temperature_c     -1 \u00b0C\n");
  EXPECT_EQ(json_fields(10, le_words(temperature)), "{\"code\":11,\"temperature_c\":-1}");
}

TEST(KestrelctlDecode, StatusStopStoreAndCalibrationReport) {
  EXPECT_EQ(text(0, {0xff, 1}),
            "type 0 (status)  len 20  pid 20000\n"
            "  sensor_type       255 (no sensor)\n"
            "  no_response       1 (no answer within the daemon's wait)\n");
  EXPECT_EQ(json_fields(3, le_words({5, 0})), "{\"code\":5,\"sensor\":\"light\"}");
  EXPECT_EQ(text(7, le_words({2, 1})),
            "type 7 (store_calibration)  len 24  pid 20000\n"
            "  pdata_sensor_type 2 (mag)\n"
            "  result            1 (no completion within the daemon's wait)\n");

  // The magnetometer's words in hex; words are unsigned in JSON.
  EXPECT_EQ(text(5, le_words({2, 0x04030201, -1, 0, 0, 0, 0, 0, 0, 9, 0})),
            "type 5 (calibration_report)  len 60  pid 20000\n"
            "  pdata_sensor_type 2 (mag)\n"
            "  words             0x04030201 0xffffffff 0x00000000 0x00000000 0x00000000 "
            "0x00000000 0x00000000 0x00000000 0x00000009\n"
            "  result            0 (read)\n");
  EXPECT_EQ(json_fields(5, le_words({5, -1, 0, 0, 0, 0, 0, 0, 0, 0, -1})),
            "{\"pdata_sensor_type\":5,\"sensor\":\"light\","
            "\"words\":[4294967295,0,0,0,0,0,0,0,0],\"result\":-1}");
}

TEST(KestrelctlDecode, SamplesPrintOnOneLineWithUnits) {
  auto sample = [](int32_t code, std::vector<int16_t> v) {
    std::vector<uint8_t> p = le_words({code});
    for (int16_t x : v) {
      p.push_back(static_cast<uint8_t>(x));
      p.push_back(static_cast<uint8_t>(static_cast<uint16_t>(x) >> 8));
    }
    return p;
  };
  EXPECT_EQ(text(2, sample(0, {2048, -4096, 417, 9, 9, 9})),
            "type 2 (sample)  len 32  pid 20000  code 0 (accel)  "
            "values x=2048 y=-4096 z=417 (0.500 -1.000 0.102 g)\n");
  EXPECT_EQ(text(2, sample(2, {666, -1, 0, 0, 0, 0})),
            "type 2 (sample)  len 32  pid 20000  code 2 (mag)  "
            "values x=666 y=-1 z=0 (99.90 -0.15 0.00 \u00b5T)\n");
  EXPECT_EQ(text(2, sample(4, {1, 2, 3, 4, 5, -32768})),
            "type 2 (sample)  len 32  pid 20000  code 4 (raw data)  values 1 2 3 4 5 -32768\n");
  EXPECT_EQ(json_fields(2, sample(-1, {0, 0, 0, 0, 0, 4464})),
            "{\"code\":-1,\"sensor\":\"no sensor\",\"values\":[0,0,0,0,0,4464]}");
}

TEST(KestrelctlDecode, MagRepliesLpfThresholdsAndRefresh) {
  std::vector<uint8_t> fuse = le_words({2, 64, -128, 0, 0, 0, 0, 0, -1});
  EXPECT_EQ(text(11, fuse),
            "type 11 (mag_fuse_rom)  len 52  pid 20000\n"
            "  code              2 (mag)\n"
            "  fuse_rom          64 -128 0 (sensitivity 1.5 0 1)\n"
            "  result            -1 (no outcome)\n");
  std::vector<uint8_t> registers = le_words({2, 0, 0, 0, 0, 0, 0, 0, 1});
  const uint8_t bytes[14] = {0xff, 0x09, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 0x80};
  memcpy(registers.data() + 16, bytes, sizeof bytes);
  EXPECT_EQ(json_fields(12, registers),
            "{\"code\":2,\"sensor\":\"mag\",\"registers\":\"ff090102030405060708090a0b80\","
            "\"result\":1}");

  EXPECT_EQ(json_fields(15, le_words({12, 0, 1})), "{\"code\":12,\"lpf_on_off\":1}");

  // Each threshold frame fills only its own pair of words.
  EXPECT_EQ(json_fields(30, le_words({5, -3, 77, 88})), "{\"high\":5,\"low\":-3}");
  EXPECT_EQ(json_fields(33, le_words({77, 88, 7, -9})), "{\"hd_high\":7,\"hd_low\":-9}");
}

TEST(KestrelctlDecode, RegisterDumpTableAddressesFollowTheIndex) {
  std::vector<uint8_t> dump(129);
  for (size_t i = 1; i < dump.size(); ++i) dump[i] = static_cast<uint8_t>(i - 1);
  dump[0] = 2;
  std::string rows;
  for (int r = 0; r < 8; ++r) {
    char line[80];
    snprintf(line, sizeof line, "      0x%02x", r * 16);
    rows += line;
    for (int c = 0; c < 16; ++c) {
      snprintf(line, sizeof line, " %02x", r * 16 + c);
      rows += line;
    }
    rows += "\n";
  }
  EXPECT_EQ(text(20, dump),
            "type 20 (register_dump)  len 148  pid 20000\n"
            "  index             2 (mag)\n"
            "  registers         0x00-0x7f\n"
            "           00 01 02 03 04 05 06 07 08 09 0a 0b 0c 0d 0e 0f\n" +
                rows);
  dump[0] = 5;
  const std::string high = text(20, dump);
  EXPECT_NE(high.find("  registers         0x80-0xff\n"), std::string::npos);
  EXPECT_NE(high.find("\n      0x80 00 01 02"), std::string::npos);
  EXPECT_NE(high.find("\n      0xf0 70 71 72"), std::string::npos);
  EXPECT_EQ(json_fields(20, dump),
            "{\"index\":5,\"sensor\":\"light-short\",\"first_address\":128,\"registers\":\"" +
                to_hex(dump.data() + 1, 128) + "\"}");
}

TEST(KestrelctlDecode, JsonCarriesHeaderPayloadAndMarks) {
  EXPECT_EQ(format_json(decode(34, {4, 1})),
            "{\"type\":34,\"name\":\"hh_refresh\",\"len\":20,\"pid\":20000,"
            "\"fields\":{\"value\":260},\"payload\":\"04010000\"}");
  // Unknown types and short payloads: the bytes only, with the reason for the latter.
  EXPECT_EQ(format_json(decode(21, {0xde, 0xad})),
            "{\"type\":21,\"name\":\"unknown\",\"len\":20,\"pid\":20000,\"fields\":{},"
            "\"payload\":\"dead0000\"}");
  EXPECT_EQ(text(21, {0xde, 0xad}),
            "type 21 (unknown)  len 20  pid 20000\n"
            "  payload           de ad 00 00\n");
  EXPECT_EQ(format_json(decode(9, le_words({0, 1})), true),
            "{\"type\":9,\"name\":\"selftest\",\"len\":24,\"pid\":20000,\"fields\":{},"
            "\"payload\":\"0000000001000000\",\"problem\":\"a payload of 8 bytes is shorter "
            "than the 72 bytes of its layout\",\"unrelated\":true}");

  EXPECT_EQ(json_string("a\"b\\c\nd\x01"), "\"a\\\"b\\\\c\\nd\\u0001\"");
}

TEST(KestrelctlParse, NumbersSensorsAndHex) {
  int32_t v = 0;
  EXPECT_TRUE(parse_int32("-2147483648", &v));
  EXPECT_EQ(v, INT32_MIN);
  EXPECT_TRUE(parse_int32("0xffffffff", &v));
  EXPECT_EQ(v, -1);
  EXPECT_TRUE(parse_int32("0X1f", &v));
  EXPECT_EQ(v, 31);
  EXPECT_TRUE(parse_int32("+7", &v));
  EXPECT_EQ(v, 7);
  for (const char* bad :
       {"", "-", "0x", "2147483648", "0x100000000", "12a", "1.5", "-0x80000001"}) {
    EXPECT_FALSE(parse_int32(bad, &v)) << bad;
  }

  const std::pair<const char*, int32_t> sensors[] = {
      {"accel", 0},       {"gyroscope", 1}, {"mag", 2}, {"pressure", 3}, {"light", 4},
      {"light-short", 5}, {"-1", -1},       {"16", 16}, {"0x0c", 12}};
  for (const auto& s : sensors) {
    ASSERT_TRUE(parse_sensor(s.first, &v)) << s.first;
    EXPECT_EQ(v, s.second) << s.first;
  }
  EXPECT_FALSE(parse_sensor("Accel", &v));
  EXPECT_FALSE(parse_sensor("light-", &v));

  EXPECT_EQ(sensor_type_name(8), "mag");
  EXPECT_EQ(sensor_type_name(6), "sensor 60");
  EXPECT_EQ(sensor_type_name(7), "no sensor");
  EXPECT_EQ(sensor_type_name(-1), "no sensor");
  EXPECT_EQ(command_name(22), "bigdata");
  EXPECT_EQ(command_name(30), "unknown");

  std::vector<uint8_t> bytes;
  std::string error;
  ASSERT_TRUE(parse_hex(" 14 00\tAb\n0f ", &bytes, &error));
  EXPECT_EQ(bytes, (std::vector<uint8_t>{0x14, 0x00, 0xab, 0x0f}));
  EXPECT_FALSE(parse_hex("140", &bytes, &error));
  EXPECT_EQ(error, "odd number of hex digits");
  EXPECT_FALSE(parse_hex("0x14", &bytes, &error));
  EXPECT_EQ(error, "'x' is not a hex digit");
}

}  // namespace
}  // namespace kestrelctl
