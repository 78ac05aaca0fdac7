// Self tests: the test request of every test type, the replies built from the stored results
// (type 9, the gyroscope's types 14 and 10), and what a missing or late answer does to them.
#include <limits.h>

#include <thread>

#include "request_test_support.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"

namespace request_test {
namespace {

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

struct SelftestCase {
  uint16_t command;
  int32_t sensor_type;
  int32_t test_type;  // as logged
  int32_t id;
  int32_t handle_arg;
  uint32_t test_kind;
  const char* chip_line;  // null: none
};

class SelftestRequestTest : public RequestTest,
                            public ::testing::WithParamInterface<SelftestCase> {};

TEST_P(SelftestRequestTest, WritesTheTestRequestOfItsType) {
  const SelftestCase& c = GetParam();
  // Every test is answered at once with an indication for the sensor the request named.
  sim->set_request_hook([](Simulator& s, const Request& r) {
    s.indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(r.body[0], 3, 0, 0, 0, {}));
  });
  command(c.command, {c.sensor_type});

  const uint8_t id_byte = static_cast<uint8_t>(c.id);
  const Request r = next();
  EXPECT_THAT(r, IsRequest(0, 13, 12, 4));
  EXPECT_EQ(r.body, test_request(id_byte, c.test_kind, 1, 1));

  std::vector<std::string> expected = {
      "process_message: " + std::to_string(c.command),
      "get_selftest_result: sensor_type = " + std::to_string(c.test_type) +
          ", id = " + std::to_string(c.id) + "\n",
      "sensor1_open_or_reopen: sensor1_open success\n",
      "get_handle_for_sensor: id:" + std::to_string(c.handle_arg) + "\n"};
  if (c.chip_line != nullptr)
    expected.push_back(std::string("get_selftest_result: ") + c.chip_line);
  expected.push_back("get_selftest_result: msg_hdr.msg_id = 0xd, id = " + std::to_string(id_byte) +
                     "\n");
  expected.push_back("waiting for response IN - timeout=8000");
  expected.push_back("wait_for_response: response received.");
  std::vector<std::string> got = main_lines();
  got.resize(std::min(got.size(), expected.size()));
  EXPECT_THAT(got, ElementsAreArray(expected));
}

INSTANTIATE_TEST_SUITE_P(
    TestTypes, SelftestRequestTest,
    ::testing::Values(SelftestCase{8, 0, 0, 0, 0, 6, "LSM6DSM ACCEL SELFTEST, TestType = (6)\n"},
                      SelftestCase{8, 1, 1, 10, 1, 6, "LSM6DSM GYRO SELFTEST\n"},
                      SelftestCase{8, 2, 2, 20, 2, 6, "AK09916C MAG SELFTEST, TestType = (6)\n"},
                      SelftestCase{8, 3, 3, 30, 3, 6, "LPS22HB PRESSURE EEPROM, TestType = (6)\n"},
                      // The gyroscope temperature opens the connection as the gyroscope.
                      SelftestCase{10, 0, 11, 10, 1, 13, "LSM6DSM GYRO TEMPERATURE\n"},
                      SelftestCase{8, 4, 4, 40, 4, 3, nullptr},
                      SelftestCase{8, 7, 7, -1, 7, 3, nullptr},
                      SelftestCase{8, 20, 20, -1, 20, 3, nullptr}));

using SelftestReplyTest = RequestTest;

TEST_F(SelftestReplyTest, AccelMagAndPressureRepliesAreBuiltFromTheirWords) {
  answer_tests(0, 6, {1, 2, 3, 4, 5, 6, 7, 8});
  command(8, {0});
  EXPECT_EQ(frame(9), word_frame(9, {0, 1, 5, 6, 7, 8, 2, 3, 4}, 18));

  answer_tests(20, 6, {10, 11, 12, 13, 14, 15, 16, 17, 18, 19, 20, 21, 22, 23, 24, 25});
  sim->clear_requests();
  command(8, {2});
  EXPECT_EQ(frame(9),
            word_frame(9, {2, 10, 11, 0, 0, 0, 0, 0, 0, 12, 13, 14, 15, 16, 17, 18, 19}, 18));
  // The magnetometer's calibration is reset after its reply.
  EXPECT_EQ(lines().back(), "send_mag_selftest_result: id == SNS_SMGR_ID_MAG_V01");
  EXPECT_THAT(next(), IsRequest(0, 13, 12, 4));
  const Request reset = next();
  EXPECT_THAT(reset, IsRequest(0, 38, 3, 4));
  EXPECT_EQ(reset.body, Bytes({0, 20, 0}));

  // Pressure word 2 is word 1 × 0.01, truncated toward zero.
  answer_tests(30, 6, {7, 101325});
  command(8, {3});
  EXPECT_EQ(frame(9), word_frame(9, {3, 7, 1013}, 18));
  answer_tests(30, 6, {7, -150});
  command(8, {3});
  EXPECT_EQ(frame(9), word_frame(9, {3, 7, -1}, 18));
}

TEST_F(SelftestReplyTest, GyroSelftestAndTemperatureReplies) {
  // g2..g4 divide toward zero; g9 - g6 overflows 32 bits, and so does its negation.
  answer_tests(10, 6, {1, 100, -1999, 1999, 0, 55, -2, 40, 50, INT_MAX, 30, -50});
  command(8, {1});
  EXPECT_EQ(
      frame(14),
      word_frame(14, {1, 100, 55, -1, 1, 0, -2, 40, 50, INT_MAX, 30, -50, INT_MAX, 10, 100}, 15));
  EXPECT_THAT(last_lines(2),
              ElementsAre("send_gyro_selftest_result: test type 1\n",
                          "send_gyro_selftest_result: 100, -1999, 1999, 0, 55, -2, 40, 50, "
                          "2147483647, 30, -50\n"));

  // -1.5 × 65536 truncates to -1.
  answer_tests(10, 13, {2, -98304, 7});
  command(10);
  EXPECT_EQ(frame(10), word_frame(10, {11, -1}, 15));
}

TEST_F(SelftestReplyTest, WithoutAnAnswerTheReplyComesFromTheStoredResults) {
  // No gyroscope result has ever come: no frame at all.
  command(10);
  EXPECT_THAT(last_lines(2), ElementsAre("get_selftest_result: ERROR: No response for command",
                                         "send_gyro_selftest_result: wrong test type 0\n"));
  EXPECT_TRUE(no_frame());

  answer_tests(0, 6, {1, 2, 3, 4, 5, 6, 7, 8});
  command(8, {0});
  const Bytes answered = frame(9);
  sim->set_request_hook(nullptr);
  command(8, {0});
  EXPECT_EQ(lines().back(), "get_selftest_result: ERROR: No response for command");
  EXPECT_EQ(frame(9), answered);
  EXPECT_EQ(factory_state().test_status, -1);
}

TEST_F(SelftestReplyTest, ALateIndicationIsTakenByTheNextWait) {
  command(8, {3});
  EXPECT_EQ(frame(9), word_frame(9, {3}, 18));
  // The answer comes after the test gave up. Its log line precedes the hand-over itself, so the
  // test waits for the flag too.
  sim->indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(30, 6, 0, 0, 0, {5, 200}));
  ASSERT_TRUE(log->wait_for("rcv_complete: result - 0\n", 2000ms));
  for (int i = 0; i < 400 && !command_waiter_arrived_for_testing(); ++i) {
    std::this_thread::sleep_for(5ms);
  }
  command(8, {3});
  EXPECT_EQ(frame(9), word_frame(9, {3, 5, 2}, 18));
  EXPECT_THAT(last_lines(3), ElementsAre("waiting for response IN - timeout=8000",
                                         "wait_for_response: cb has arrived without waiting",
                                         "wait_for_response: response received."));
}

}  // namespace
}  // namespace request_test
