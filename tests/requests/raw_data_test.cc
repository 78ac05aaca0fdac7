// Raw-data streams: the sensor manager's report request byte for byte, the light sensor's
// driver requests, the stop replies, the magnetometer's once-only steps, and the write failures
// after which a stream operation carries on.
#include "request_test_support.h"
#include "requests/register_access.h"
#include "service_link/factory_state.h"

namespace request_test {
namespace {

using kestrel_sim::FaultOp;
using ::testing::ElementsAre;

// The report request that starts a stream of one sensor-manager sensor.
Bytes report(uint8_t id, uint16_t rate, bool accel) {
  Bytes b(272, 0);
  b[0] = static_cast<uint8_t>(id + 5);
  b[1] = 1;
  put16(b, 2, rate);
  b[4] = 1;
  put32(b, 8, 1);
  b[12] = id;
  b[15] = 3;
  b[212] = 1;
  put32(b, 216, 1);
  b[220] = accel ? 1 : 2;
  if (accel) {
    b[232] = 1;
    put32(b, 236, 1);
    put16(b, 240, 1);
  }
  return b;
}

std::vector<float> sensitivities() {
  const mag_sensitivity_values s = mag_sensitivity();
  return {s.x, s.y, s.z};
}

Bytes report_stop(uint8_t id) {
  Bytes b(272, 0);
  b[0] = static_cast<uint8_t>(id + 5);
  b[1] = 2;
  return b;
}

using RawDataTest = RequestTest;

TEST_F(RawDataTest, ReportRequestsOfTheSensorManager) {
  struct Case {
    int32_t sensor_type;
    Bytes body;
    int32_t logged_id;
  };
  const Case cases[] = {
      {0, report(0, 100, true), 0},
      {2, report(20, 50, false), 20},
      {7, report(0xff, 100, false), -1},  // no sensor: report id 4, SensorId 0xFF
      {8, report(20, 100, false), 20},    // the magnetometer's id, at the common rate
  };
  for (const Case& c : cases) {
    log->clear();
    command(1, {c.sensor_type});
    Request r = next();
    if (c.sensor_type == 2) r = next();  // after the calibration reset
    EXPECT_THAT(r, IsRequest(0, 2, 272, 2));
    EXPECT_EQ(r.body, c.body) << "sensor_type " << c.sensor_type;
    EXPECT_EQ(main_lines().back(),
              "get_raw_data: sensor_type = " + std::to_string(c.logged_id) + " txn_id = 2\n");
  }
  EXPECT_TRUE(no_frame());  // a start answers nothing
}

TEST_F(RawDataTest, LightSensorRequestsAndStopReplies) {
  struct Case {
    uint16_t command;
    int32_t sensor_type;
    uint32_t request_id;
    uint32_t data;
  };
  const Case cases[] = {
      {1, 4, 60, 10000}, {3, 4, 62, 100000}, {1, 5, 50, 10000}, {3, 5, 52, 100000}};
  for (const Case& c : cases) {
    log->clear();
    command(c.command, {c.sensor_type});
    const Request r = next();
    EXPECT_THAT(r, IsRequest(44, 32, 288, 123));
    EXPECT_EQ(r.body, daf_request(kLightSuid, c.request_id, words({static_cast<int32_t>(c.data)})));
    const std::string name = c.command == 1 ? "get_raw_data" : "stop_raw_data";
    EXPECT_THAT(last_lines(2),
                ElementsAre(name + " sensor_type:" + std::to_string(c.sensor_type) + "\n",
                            name + ": sensor_type = 40 txn_id = 123\n"));
    if (c.command == 3) {
      EXPECT_EQ(frame(3), expected_frame(3, words({5, 0})));
    }
  }

  command(3, {2});
  EXPECT_EQ(next().body, report_stop(20));
  EXPECT_EQ(frame(3), expected_frame(3, words({2, 0})));
  command(3, {10});
  EXPECT_EQ(next().body, report_stop(0xff));
  EXPECT_EQ(frame(3), expected_frame(3, words({-1, 0})));
}

TEST_F(RawDataTest, MagnetometerResetsItsCalibrationOncePerStreamAndKeepsFuseRomSensitivities) {
  command(1, {2});
  EXPECT_THAT(main_lines(),
              ElementsAre("process_message: 1", "sensor1_open_or_reopen: sensor1_open success\n",
                          "get_handle_for_sensor: id:2\n", "get_raw_data: Reset Mag Cal IN",
                          "get_raw_data: Reset Mag Cal OUT",
                          "get_raw_data: sensor_type = 20 txn_id = 2\n"));
  EXPECT_THAT(sensitivities(), ElementsAre(1.0f, 1.0f, 1.0f));

  // A fuse-ROM read that is not sent to the kernel sets the sensitivities: word / 128 + 1.
  answer_tests(20, 9, {64, -128, 0});
  get_mag_register_data(8, 0);
  sim->set_request_hook(nullptr);
  EXPECT_THAT(sensitivities(), ElementsAre(1.5f, 0.0f, 1.0f));

  command(1, {2});
  command(3, {2});
  command(1, {2});
  EXPECT_THAT(sensitivities(), ElementsAre(1.5f, 0.0f, 1.0f));

  // Start, start, stop, start: the reset goes out before the first start and after the stop.
  std::vector<std::string> kinds;
  for (int i = 0; i < 7; ++i) {
    const Request r = next();
    if (r.header.msg_id == 38) {
      kinds.push_back("reset");
    } else if (r.header.msg_id == 13) {
      kinds.push_back("fuse rom");
    } else {
      kinds.push_back(r.body.at(1) == 1 ? "start" : "stop");
    }
  }
  EXPECT_THAT(kinds, ElementsAre("reset", "start", "fuse rom", "start", "stop", "reset", "start"));
  EXPECT_EQ(sim->requests().at(0).body, Bytes({0, 20, 0}));
  EXPECT_TRUE(kernel->receive_type(11, 100ms) == std::nullopt);
}

TEST_F(RawDataTest, WriteFailuresAreLoggedAndTheStopStillReplies) {
  struct Case {
    uint16_t command;
    int32_t sensor_type;
    const char* line;
  };
  const Case cases[] = {
      {1, 0, "[get_raw_data]sensor1_write -error  -3\n"},
      {3, 2, "[stop_raw_data]sensor1_write -error  -3 2\n"},
      {1, 5, "[DAF][get_raw_data]sensor1_write -error  -3 5\n"},
      {3, 4, "[DAF][stop_raw_data]sensor1_write -error  -3 4\n"},
  };
  command(3, {0});  // opens the connection
  next();
  frame(3);
  for (const Case& c : cases) {
    ASSERT_TRUE(sim->fault(FaultOp::kWrite, -3, 1));
    log->clear();
    command(c.command, {c.sensor_type});
    EXPECT_EQ(last_lines(2).front(), c.line);
  }
  EXPECT_EQ(frame(3), expected_frame(3, words({2, 0})));
  EXPECT_EQ(frame(3), expected_frame(3, words({5, 0})));
  EXPECT_EQ(sim->requests().size(), 1u);    // none of the failed writes went out
  EXPECT_EQ(sim->opened_connections(), 1);  // the stream operations never close
}

TEST_F(RawDataTest, AStreamOfTheHealthyPhoneReachesTheKernel) {
  sim->set_healthy(true);
  command(1, {0});
  std::optional<KernelFrame> sample = kernel->receive_type(2, 2000ms);
  ASSERT_TRUE(sample.has_value());
  EXPECT_EQ(sample->len, 32u);
  EXPECT_EQ(sample->word(0), 0);
  command(3, {0});
  EXPECT_EQ(frame(3), expected_frame(3, words({0, 0})));
}

}  // namespace
}  // namespace request_test
