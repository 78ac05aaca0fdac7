// SPDX-License-Identifier: Apache-2.0
// Self tests: the test request of every test type, the replies built from the stored results
// (type 9, the gyroscope's types 14 and 10), and what a missing or late answer does to them.
#include <limits.h>

#include <thread>

#include "request_fixture.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"

namespace request_test {
namespace {

using SelftestTest = RequestTest;

TEST_F(SelftestTest, EachTestTypeWritesItsRequest) {
  // command, sensor_type, test type and id as logged, handle argument, TestType, chip line
  const std::tuple<uint16_t, int32_t, int32_t, int32_t, int32_t, uint32_t, std::string> cases[] = {
      {8, 0, 0, 0, 0, 6, "LSM6DSM ACCEL SELFTEST, TestType = (6)\n"},
      {8, 1, 1, 10, 1, 6, "LSM6DSM GYRO SELFTEST\n"},
      {8, 2, 2, 20, 2, 6, "AK09916C MAG SELFTEST, TestType = (6)\n"},
      {8, 3, 3, 30, 3, 6, "LPS22HB PRESSURE EEPROM, TestType = (6)\n"},
      // The gyroscope temperature opens the connection as the gyroscope.
      {10, 0, 11, 10, 1, 13, "LSM6DSM GYRO TEMPERATURE\n"},
      {8, 4, 4, 40, 4, 3, ""},
      {8, 6, 6, 60, 6, 3, ""},
      {8, 7, 7, -1, 7, 3, ""},
      {8, 20, 20, -1, 20, 3, ""}};
  answer_tests();
  for (const auto& [number, sensor_type, test_type, id, handle_arg, kind, chip] : cases) {
    reset_connection_for_testing();
    log->clear();
    kernel->drain(0ms);
    command(number, {sensor_type});
    const uint8_t id_byte = static_cast<uint8_t>(id);
    EXPECT_THAT(next(), IsRequest(0, 13, 4, test_request(id_byte, kind, 1, 1)));
    Lines expected = {"process_message: " + std::to_string(number),
                      "get_selftest_result: sensor_type = " + std::to_string(test_type) +
                          ", id = " + std::to_string(id) + "\n",
                      "sensor1_open_or_reopen: sensor1_open success\n",
                      "get_handle_for_sensor: id:" + std::to_string(handle_arg) + "\n"};
    if (!chip.empty()) expected.push_back("get_selftest_result: " + chip);
    expected.insert(
        expected.end(),
        {"get_selftest_result: msg_hdr.msg_id = 0xd, id = " + std::to_string(id_byte) + "\n",
         "waiting for response IN - timeout=8000", "wait_for_response: response received."});
    Lines got = main_lines();
    got.resize(std::min(got.size(), expected.size()));
    EXPECT_THAT(got, ElementsAreArray(expected));
    if (sensor_type == 2 && number == 8) next();  // the calibration reset that follows
    // Sensors without a self-test reply send the kernel nothing.
    if (id == 40 || id == 60 || id == -1) {
      EXPECT_TRUE(no_frame()) << sensor_type;
    }
  }
}

TEST_F(SelftestTest, RepliesAreBuiltFromTheWordsOfTheIndication) {
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
  EXPECT_EQ(next().header.msg_id, 13);
  EXPECT_THAT(next(), IsRequest(0, 38, 4, Bytes({0, 20, 0})));

  // Pressure word 2 is word 1 × 0.01, truncated toward zero; a failed test's words count too.
  for (const auto& [word0, pressure, hpa, error] :
       {std::tuple{7, 101325, 1013, -1}, {7, -150, -1, -1}, {9, 500, 5, 2}}) {
    answer_tests(30, 6, {word0, pressure}, error);
    command(8, {3});
    EXPECT_EQ(frame(9), word_frame(9, {3, word0, hpa}, 18));
  }

  // Gyroscope: g2..g4 divide toward zero; g9 - g6 overflows 32 bits, and so does its negation.
  answer_tests(10, 6, {1, 100, -1999, 1999, 2000, 55, -2, 40, 50, INT_MAX, 30, -50});
  command(8, {1});
  EXPECT_EQ(
      frame(14),
      word_frame(14, {1, 100, 55, -1, 1, 2, -2, 40, 50, INT_MAX, 30, -50, INT_MAX, 10, 100}, 15));
  EXPECT_THAT(last_lines(2),
              ElementsAre("send_gyro_selftest_result: test type 1\n",
                          "send_gyro_selftest_result: 100, -1999, 1999, 2000, 55, -2, 40, 50, "
                          "2147483647, 30, -50\n"));
  // The temperature: -1.5 × 65536 truncates to -1.
  answer_tests(10, 13, {2, -98304, 7});
  command(10);
  EXPECT_EQ(frame(10), word_frame(10, {11, -1}, 15));
}

TEST_F(SelftestTest, WithoutAnAnswerTheReplyComesFromTheStoredResults) {
  // No gyroscope result has ever come: no frame at all, after the whole (scaled) 8 s wait.
  const auto started = std::chrono::steady_clock::now();
  command(10);
  EXPECT_GE(std::chrono::steady_clock::now() - started, scaled(8000ms));
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

TEST_F(SelftestTest, ALateIndicationIsTakenByTheNextWait) {
  command(8, {3});
  EXPECT_EQ(frame(9), word_frame(9, {3}, 18));
  // The answer comes after the test gave up. Its log line precedes the hand-over itself, so the
  // test waits for the flag too.
  sim->indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(30, 6, 0, 0, 0, {5, 200}));
  ASSERT_TRUE(log->wait_for("rcv_complete: result - 0\n", 2000ms));
  ASSERT_TRUE(eventually(command_waiter_arrived_for_testing, 2000ms));
  command(8, {3});
  EXPECT_EQ(frame(9), word_frame(9, {3, 5, 2}, 18));
  EXPECT_THAT(last_lines(3), ElementsAre("waiting for response IN - timeout=8000",
                                         "wait_for_response: cb has arrived without waiting",
                                         "wait_for_response: response received."));
}

}  // namespace
}  // namespace request_test
