// SPDX-License-Identifier: Apache-2.0
// Command 4 against the registry stand-in: the report frame byte for byte, and the daemon's and
// the registry library's log lines in the order they were made. The moment the report leaves
// is marked in the log by the frame allocator seam, so the close can be seen to come after it.
#include <stdlib.h>

#include <android/log.h>

#include "kernel_channel/netlink_channel.h"
#include "request_fixture.h"

namespace request_test {
namespace {

constexpr char kSent[] = "-- report sent --";

// Logs a marker for every block of an outbound frame, then allocates it.
void* marking_malloc(size_t size) {
  __android_log_print(ANDROID_LOG_INFO, "test", "%s", kSent);
  return malloc(size);
}

// The report frame: the code, nine words and the result.
Bytes report(int32_t type, std::vector<int32_t> w, int32_t result) {
  w.resize(9);
  w.insert(w.begin(), type);
  w.push_back(result);
  return word_frame(5, w);
}

class RegistryReaderTest : public RequestTest {
 protected:
  void SetUp() override {
    RequestTest::SetUp();
    set_netmgr_malloc_for_testing(&marking_malloc);
  }

  // Runs command 4 for sensor_type with the registry file text; returns the report frame.
  Bytes read(int32_t sensor_type, const std::string& registry) {
    write_file(test_registry_path(), registry);
    log->clear();
    command(4, {sensor_type});
    return frame(5);
  }

  // "<P> <tag> <message>" of every record but the dispatcher's, the marker once a frame.
  Lines trace() const {
    Lines out;
    for (const LogRecord& r : log->records()) {
      if (r.message.rfind("process_message", 0) == 0) continue;
      if (r.message != kSent) {
        out.push_back(r.letter() + r.tag + " " + r.message);
      } else if (out.empty() || out.back() != kSent) {
        out.push_back(kSent);
      }
    }
    return out;
  }

  // The trace of a registry that opens at once, with the lines between the open and the report.
  static Lines opened_trace(int32_t type, const Lines& middle) {
    Lines t = {"I KESTRELD read_calib_data: sensor_type " + std::to_string(type) + "\n",
               "I libsensor_reg open -> 0", "E KESTRELD Inside While 0, count 50",
               "I KESTRELD Outside While 0"};
    t.insert(t.end(), middle.begin(), middle.end());
    t.insert(t.end(), {kSent, "I libsensor_reg close -> 0"});
    return t;
  }
};

TEST_F(RegistryReaderTest, AccelerometerAndGyroscopeTakeTheFirstByteOfEachOffset) {
  EXPECT_EQ(read(0, "0 = 00 7f\n1 = 00\n2 = 05 01 02\n"), report(0, {0, 0, 5}, 1));
  EXPECT_THAT(trace(),
              ElementsAreArray(opened_trace(
                  0, {"I libsensor_reg read 0 -> 0 len 2", "I libsensor_reg read 1 -> 0 len 1",
                      "I libsensor_reg read 2 -> 0 len 3",
                      "I KESTRELD read_calib_data: ID=0, Type=0, Result=1, Val=0,0,5"})));
  // All three zero, one of them an item of no bytes: no offsets at all.
  EXPECT_EQ(read(12, "0 = 00 09\n1 =\n2 = 00\n"), report(0, {0, 0, 0}, -1));
  // The gyroscope's offsets count even when all are zero.
  EXPECT_EQ(read(1, "300 = 00\n301 = 00\n302 = 00\n"), report(1, {0, 0, 0}, 0));
}

TEST_F(RegistryReaderTest, MagnetometerDecodesUpToFourBytesLittleEndian) {
  const std::string registry =
      "406 = 01 02 03 04\n407 = 01 02\n408 = 01 02 03 04 05 06 07 08\n409 =\n"
      "410 = ff ff ff ff\n411 = 10\n412 = 20\n413 = 30\n414 = 00 00 00 80\n";
  EXPECT_EQ(read(2, registry),
            report(2, {0x04030201, 0x0201, 0x04030201, 0, -1, 0x10, 0x20, 0x30, INT32_MIN}, 0));
  EXPECT_THAT(lines(),
              testing::Contains("SI param 0x04030201 0x00000201 0x04030201 0x00000000 "
                                "0xffffffff 0x00000010 0x00000020 0x00000030 0x80000000 "));
  // One failing read: every word goes, though the line shows what was decoded.
  EXPECT_EQ(read(9, registry + "read_error 412 = 3\n"), report(2, {}, -1));
  EXPECT_THAT(lines(),
              testing::Contains("SI param 0x04030201 0x00000201 0x04030201 0x00000000 "
                                "0xffffffff 0x00000010 0x00000000 0x00000030 0x80000000 "));
}

TEST_F(RegistryReaderTest, LightSensorWordsFollowTheDriversOrder) {
  const std::string registry =
      "102 = 02 01\n119 = 19 01\n120 = 20 01\n123 = 23\n124 = fe ff ff ff\n"
      "125 = 25 01\n126 = 26 01\n";
  // 120 goes to word 1 and 119 to word 2; 126 to word 5 and 125 to word 6.
  EXPECT_EQ(read(4, registry), report(5, {0x102, 0x120, 0x119, 0x23, -2, 0x126, 0x125}, 0));
  Lines middle;
  for (const char* item : {"102 -> 0 len 2", "119 -> 0 len 2", "120 -> 0 len 2", "123 -> 0 len 1",
                           "124 -> 0 len 4", "125 -> 0 len 2", "126 -> 0 len 2"}) {
    middle.push_back(std::string("I libsensor_reg read ") + item);
  }
  middle.insert(middle.end(),
                {"I KESTRELD pdata.trim -2",
                 "I KESTRELD read_calib_data: ID=40, Type=5, Result=0, Val=258,288,281"});
  EXPECT_THAT(trace(), ElementsAreArray(opened_trace(5, middle)));
  // One failing read: words 0..2 go, the decoded words 3..6 stay.
  EXPECT_EQ(read(5, registry + "read_error 102 = 2\n"),
            report(5, {0, 0, 0, 0x23, -2, 0x126, 0x125}, -1));
}

TEST_F(RegistryReaderTest, SensorsWithoutItemsStillOpenAndCloseTheRegistry) {
  const std::tuple<int32_t, int32_t, int32_t> cases[] = {{3, 30, 3},   {6, 60, 6},   {7, -1, -1},
                                                         {10, -1, -1}, {16, -1, -1}, {-1, -1, -1}};
  for (const auto& [sensor_type, id, type] : cases) {
    EXPECT_EQ(read(sensor_type, "0 = 01\n300 = 01\n"), report(type, {}, -1));
    EXPECT_THAT(trace(), ElementsAreArray(opened_trace(
                             type, {"I KESTRELD read_calib_data: ID=" + std::to_string(id) +
                                    ", Type=" + std::to_string(type) + ", Result=-1, Val=0,0,0"})));
  }
}

TEST_F(RegistryReaderTest, OpenIsTriedFiftyTimesAndTheCloseComesAfterTheReport) {
  // Two failures, then the registry opens and the reads find it open.
  EXPECT_EQ(read(0, "open_failures = 2\n0 = 01\n1 = 02\n2 = 03\n"), report(0, {1, 2, 3}, 1));
  Lines t = trace();
  ASSERT_GE(t.size(), 8u);
  EXPECT_THAT(Lines(t.begin() + 1, t.begin() + 8),
              ElementsAre("I libsensor_reg open -> -1", "E KESTRELD Inside While -1, count 50",
                          "I libsensor_reg open -> -1", "E KESTRELD Inside While -1, count 49",
                          "I libsensor_reg open -> 0", "E KESTRELD Inside While 0, count 48",
                          "I KESTRELD Outside While 0"));

  // Never opens: fifty attempts, the reads are made all the same, and the report still goes.
  EXPECT_EQ(read(0, "open_failures = 99\n0 = 01\n1 = 02\n2 = 03\n"), report(0, {}, -1));
  Lines expected = {"I KESTRELD read_calib_data: sensor_type 0\n"};
  for (int left = 50; left >= 1; --left) {
    expected.push_back("I libsensor_reg open -> -1");
    expected.push_back("E KESTRELD Inside While -1, count " + std::to_string(left));
  }
  expected.push_back("I KESTRELD Outside While -1");
  for (const char* id : {"0", "1", "2"}) {
    expected.push_back(std::string("I libsensor_reg read ") + id + " -> -1 len 0");
  }
  expected.insert(expected.end(), {"I KESTRELD read_calib_data: ID=0, Type=0, Result=-1, Val=0,0,0",
                                   kSent, "I libsensor_reg close -> 0"});
  EXPECT_THAT(trace(), ElementsAreArray(expected));

  // A failing close is logged after the report went out.
  EXPECT_EQ(read(1, "300 = 01\n301 = 02\n302 = 03\nclose_result = 7\n"), report(1, {1, 2, 3}, 0));
  t = trace();
  ASSERT_GE(t.size(), 3u);
  EXPECT_THAT(Lines(t.end() - 3, t.end()),
              ElementsAre(kSent, "I libsensor_reg close -> 7",
                          "E KESTRELD read_calib_data: Error in sensor_reg_close(): 7"));
}

}  // namespace
}  // namespace request_test
