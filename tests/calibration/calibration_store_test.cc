// SPDX-License-Identifier: Apache-2.0
// Command 6 against the simulated sensor manager: the single-sensor test request byte for byte,
// the completion that the sensor manager sends back (or does not), and the type-7 reply.
#include "calibration/calibration_store.h"
#include "request_fixture.h"
#include "service_link/factory_state.h"

namespace request_test {
namespace {

using ::testing::Contains;

class CalibrationStoreTest : public RequestTest {
 protected:
  // This command's own lines ("store_calib_data..." or "[store_calib_data]..."), each after the
  // letter of its priority.
  Lines own_lines() const {
    Lines out;
    for (const LogRecord& r : log->records()) {
      if (r.message.find("store_calib_data") > 1) continue;
      out.push_back(r.letter() + r.message);
    }
    return out;
  }
};

TEST_F(CalibrationStoreTest, EachSensorGetsItsTestTypeAndACompletedReply) {
  // sensor_type, flag, SensorID, TestType, reply code. The flag chooses the TestType of the
  // accelerometer and the light sensor, and is logged for them only.
  const std::tuple<int32_t, int32_t, uint8_t, uint32_t, int32_t> cases[] = {
      {0, 0, 0, 8, 0},    {0, 1, 0, 7, 0},  {4, 0, 40, 8, 5},   {4, 1, 40, 7, 5},
      {5, -9, 40, 7, 5},  {12, 0, 0, 8, 0}, {2, 1, 20, 0, 2},   {1, 1, 10, 3, 1},
      {3, 1, 30, 3, 3},   {6, 1, 60, 3, 6}, {7, 1, 255, 3, -1}, {16, 1, 255, 3, -1},
      {-1, 1, 255, 3, -1}};
  answer_tests();
  for (const auto& [sensor_type, flag, id, test_type, code] : cases) {
    log->clear();
    command(6, {sensor_type, flag});
    EXPECT_THAT(next(), IsRequest(0, 13, 4, test_request(id, test_type, 1, 1, 1, 1)));
    EXPECT_EQ(frame(7), word_frame(7, {code, 0}));
    Lines expected = {"I store_calib_data: Enter\n",
                      "E store_calib_data: sensor_type = " + std::to_string(sensor_type) + " \n"};
    if (id == 0 || id == 40)
      expected.push_back("I store_calib_data: CAL(" + std::to_string(flag) + ")");
    expected.push_back("I store_calib_data: SensorID:" + std::to_string(id) + ", DataType:0");
    EXPECT_THAT(own_lines(), ElementsAreArray(expected));
  }
}

TEST_F(CalibrationStoreTest, CompletionBeforeTheWaitAndNoCompletionAtAll) {
  ASSERT_NE(get_handle_for_sensor(0), nullptr);
  // A completion that lands before the command waits is taken by its wait.
  sim->indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(0, 8, 0, 0, 0, {}));
  ASSERT_TRUE(log->wait_for("rcv_complete: result - 0\n", 2000ms));
  command(6, {0, 0});
  EXPECT_EQ(frame(7), word_frame(7, {0, 0}));

  // None at all: the wait runs out and the reply says so; test_status has no outcome.
  command(6, {2, 0});
  EXPECT_EQ(frame(7), word_frame(7, {2, 1}));
  EXPECT_THAT(lines(), Contains("store_calib_data: ERROR: No response for command"));
  EXPECT_EQ(test_status(), -1);
}

}  // namespace
}  // namespace request_test
