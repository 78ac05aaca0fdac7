// Command 4 against the registry stand-in: the report frame byte for byte, and the daemon's and
// the registry library's log lines in the order they were made. The moment the report leaves
// is marked in the log by the frame allocator seam, so the close can be seen to come after it.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <android/log.h>

#include <string>
#include <vector>

#include "daemon_fixture.h"
#include "kernel_channel/netlink_channel.h"

using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

namespace {

constexpr char kSentMarker[] = "-- report sent --";

// Logs a marker for every block of an outbound frame, then allocates it.
void* marking_malloc(size_t size) {
  __android_log_print(ANDROID_LOG_INFO, "test", "%s", kSentMarker);
  return malloc(size);
}

struct report {
  int32_t type;
  std::vector<uint32_t> words;  // up to nine; the rest are 0
  int32_t result;
};

std::vector<uint8_t> report_bytes(const report& r) {
  std::vector<uint8_t> b(44, 0);
  memcpy(b.data(), &r.type, 4);
  for (size_t i = 0; i < r.words.size(); ++i) memcpy(b.data() + 4 + 4 * i, &r.words[i], 4);
  memcpy(b.data() + 40, &r.result, 4);
  return b;
}

class RegistryReaderTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    set_netmgr_malloc_for_testing(&marking_malloc);
  }

  // Runs command 4 for sensor_type with the registry file text, and returns the report payload.
  std::vector<uint8_t> read_calibration(int32_t sensor_type, const std::string& registry) {
    write_file(test_registry_path(), registry);
    log->clear();
    command(4, {sensor_type});
    const auto frame = kernel->receive_type(5, 2000ms);
    if (!frame) return {};
    EXPECT_EQ(frame->len, 60u);
    EXPECT_EQ(frame->pid, 20000u);
    return frame->payload;
  }

  // "<P> <tag> <message>" of every record but the dispatcher's, the frame marker once a frame.
  std::vector<std::string> trace() const {
    std::vector<std::string> out;
    for (const LogRecord& r : log->records()) {
      if (r.message.rfind("process_message", 0) == 0) continue;
      if (r.message == kSentMarker) {
        if (out.empty() || out.back() != kSentMarker) out.push_back(kSentMarker);
        continue;
      }
      const char p = r.priority == 4 ? 'I' : r.priority == 6 ? 'E' : '?';
      out.push_back(std::string(1, p) + " " + r.tag + " " + r.message);
    }
    return out;
  }
};

TEST_F(RegistryReaderTest, AccelerometerTakesTheFirstByteOfEachOffset) {
  EXPECT_EQ(read_calibration(0, "0 = 00 7f\n1 = 00\n2 = 05 01 02\n"),
            report_bytes({0, {0, 0, 5}, 1}));
  EXPECT_THAT(trace(),
              ElementsAre("I KESTRELD read_calib_data: sensor_type 0\n",
                          "I libsensor_reg open -> 0", "E KESTRELD Inside While 0, count 50",
                          "I KESTRELD Outside While 0", "I libsensor_reg read 0 -> 0 len 2",
                          "I libsensor_reg read 1 -> 0 len 1", "I libsensor_reg read 2 -> 0 len 3",
                          "I KESTRELD read_calib_data: ID=0, Type=0, Result=1, Val=0,0,5",
                          kSentMarker, "I libsensor_reg close -> 0"));

  // All three zero, one of them an item of no bytes: no offsets at all.
  EXPECT_EQ(read_calibration(12, "0 = 00 09\n1 =\n2 = 00\n"), report_bytes({0, {0, 0, 0}, -1}));
  EXPECT_THAT(lines(), Contains("read_calib_data: ID=0, Type=0, Result=-1, Val=0,0,0"));
}

TEST_F(RegistryReaderTest, GyroscopeReportsZeroResultEvenForZeroOffsets) {
  EXPECT_EQ(read_calibration(1, "300 = 00\n301 = 00\n302 = 00\n"), report_bytes({1, {0, 0, 0}, 0}));
  EXPECT_EQ(read_calibration(11, "300 = 81\n301 = 02\n302 = ff 01\n"),
            report_bytes({1, {0x81, 2, 0xff}, 0}));
}

TEST_F(RegistryReaderTest, MagnetometerDecodesUpToFourBytesLittleEndian) {
  const std::string registry =
      "406 = 01 02 03 04\n"              // four bytes
      "407 = 01 02\n"                    // two: zero-extended
      "408 = 01 02 03 04 05 06 07 08\n"  // eight: the first four count
      "409 =\n"                          // none: the word stays 0
      "410 = ff ff ff ff\n"
      "411 = 10\n412 = 20\n413 = 30\n414 = 00 00 00 80\n";
  EXPECT_EQ(
      read_calibration(2, registry),
      report_bytes(
          {2, {0x04030201, 0x0201, 0x04030201, 0, 0xffffffff, 0x10, 0x20, 0x30, 0x80000000}, 0}));
  EXPECT_THAT(lines(), Contains("SI param 0x04030201 0x00000201 0x04030201 0x00000000 0xffffffff "
                                "0x00000010 0x00000020 0x00000030 0x80000000 "));
  EXPECT_THAT(lines(),
              Contains("read_calib_data: ID=20, Type=2, Result=0, Val=67305985,513,67305985"));

  // One failing read: every word goes, though the line shows what was decoded.
  EXPECT_EQ(read_calibration(9, registry + "read_error 412 = 3\n"), report_bytes({2, {}, -1}));
  EXPECT_THAT(lines(), Contains("SI param 0x04030201 0x00000201 0x04030201 0x00000000 0xffffffff "
                                "0x00000010 0x00000000 0x00000030 0x80000000 "));
}

TEST_F(RegistryReaderTest, LightSensorWordsFollowTheDriversOrder) {
  const std::string registry =
      "102 = 02 01\n119 = 19 01\n120 = 20 01\n123 = 23\n124 = fe ff ff ff\n"
      "125 = 25 01\n126 = 26 01\n";
  // 120 goes to word 1 and 119 to word 2; 126 to word 5 and 125 to word 6.
  EXPECT_EQ(read_calibration(4, registry),
            report_bytes({5, {0x102, 0x120, 0x119, 0x23, 0xfffffffe, 0x126, 0x125, 0, 0}, 0}));
  EXPECT_THAT(
      trace(),
      ElementsAre("I KESTRELD read_calib_data: sensor_type 5\n", "I libsensor_reg open -> 0",
                  "E KESTRELD Inside While 0, count 50", "I KESTRELD Outside While 0",
                  "I libsensor_reg read 102 -> 0 len 2", "I libsensor_reg read 119 -> 0 len 2",
                  "I libsensor_reg read 120 -> 0 len 2", "I libsensor_reg read 123 -> 0 len 1",
                  "I libsensor_reg read 124 -> 0 len 4", "I libsensor_reg read 125 -> 0 len 2",
                  "I libsensor_reg read 126 -> 0 len 2", "I KESTRELD pdata.trim -2",
                  "I KESTRELD read_calib_data: ID=40, Type=5, Result=0, Val=258,288,281",
                  kSentMarker, "I libsensor_reg close -> 0"));

  // One failing read: words 0..2 go, the decoded words 3..6 stay.
  EXPECT_EQ(read_calibration(5, registry + "read_error 102 = 2\n"),
            report_bytes({5, {0, 0, 0, 0x23, 0xfffffffe, 0x126, 0x125}, -1}));
}

TEST_F(RegistryReaderTest, SensorsWithoutItemsStillOpenAndCloseTheRegistry) {
  const std::string registry = "0 = 01\n300 = 01\n";
  struct {
    int32_t sensor_type, id, type;
  } cases[] = {{3, 30, 3}, {6, 60, 6}, {7, -1, -1}, {10, -1, -1}, {16, -1, -1}, {-1, -1, -1}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.sensor_type);
    EXPECT_EQ(read_calibration(c.sensor_type, registry), report_bytes({c.type, {}, -1}));
    const std::string id_line = "I KESTRELD read_calib_data: ID=" + std::to_string(c.id) +
                                ", Type=" + std::to_string(c.type) + ", Result=-1, Val=0,0,0";
    EXPECT_THAT(
        trace(),
        ElementsAre("I KESTRELD read_calib_data: sensor_type " + std::to_string(c.type) + "\n",
                    "I libsensor_reg open -> 0", "E KESTRELD Inside While 0, count 50",
                    "I KESTRELD Outside While 0", id_line, kSentMarker,
                    "I libsensor_reg close -> 0"));
  }
}

TEST_F(RegistryReaderTest, OpenIsTriedFiftyTimesBackToBack) {
  // Two failures, then the registry opens and the reads find it open.
  EXPECT_EQ(read_calibration(0, "open_failures = 2\n0 = 01\n1 = 02\n2 = 03\n"),
            report_bytes({0, {1, 2, 3}, 1}));
  EXPECT_THAT(trace(),
              ElementsAre("I KESTRELD read_calib_data: sensor_type 0\n",
                          "I libsensor_reg open -> -1", "E KESTRELD Inside While -1, count 50",
                          "I libsensor_reg open -> -1", "E KESTRELD Inside While -1, count 49",
                          "I libsensor_reg open -> 0", "E KESTRELD Inside While 0, count 48",
                          "I KESTRELD Outside While 0", "I libsensor_reg read 0 -> 0 len 1",
                          "I libsensor_reg read 1 -> 0 len 1", "I libsensor_reg read 2 -> 0 len 1",
                          "I KESTRELD read_calib_data: ID=0, Type=0, Result=1, Val=1,2,3",
                          kSentMarker, "I libsensor_reg close -> 0"));

  // Never opens: fifty attempts, the reads are made all the same, and the report still goes.
  EXPECT_EQ(read_calibration(0, "open_failures = 99\n0 = 01\n1 = 02\n2 = 03\n"),
            report_bytes({0, {0, 0, 0}, -1}));
  std::vector<std::string> expected;
  for (int left = 50; left >= 1; --left) {
    expected.push_back("I libsensor_reg open -> -1");
    expected.push_back("E KESTRELD Inside While -1, count " + std::to_string(left));
  }
  expected.push_back("I KESTRELD Outside While -1");
  for (const char* id : {"0", "1", "2"}) {
    expected.push_back(std::string("I libsensor_reg read ") + id + " -> -1 len 0");
  }
  expected.push_back("I KESTRELD read_calib_data: ID=0, Type=0, Result=-1, Val=0,0,0");
  expected.push_back(kSentMarker);
  expected.push_back("I libsensor_reg close -> 0");
  std::vector<std::string> t = trace();
  t.erase(t.begin());  // the sensor_type line
  EXPECT_THAT(t, ElementsAreArray(expected));
}

TEST_F(RegistryReaderTest, FailingCloseIsLoggedAfterTheReportWentOut) {
  EXPECT_EQ(read_calibration(1, "300 = 01\n301 = 02\n302 = 03\nclose_result = 7\n"),
            report_bytes({1, {1, 2, 3}, 0}));
  std::vector<std::string> t = trace();
  ASSERT_GE(t.size(), 3u);
  EXPECT_THAT(std::vector<std::string>(t.end() - 3, t.end()),
              ElementsAre(kSentMarker, "I libsensor_reg close -> 7",
                          "E KESTRELD read_calib_data: Error in sensor_reg_close(): 7"));
}

}  // namespace
