// SPDX-License-Identifier: Apache-2.0
// Raw-data streams: the sensor manager's report request byte for byte, the light sensor's
// driver requests, the stop replies, the magnetometer's once-only steps and the sensitivities its
// samples are converted with, and a stream of the healthy phone from start to stop.
#include "byte_order.h"
#include "request_fixture.h"
#include "requests/register_access.h"

namespace request_test {
namespace {

using ::testing::Pair;

// The report request that stops the stream of one sensor-manager sensor.
Bytes report_stop(uint8_t id) {
  Bytes b(272, 0);
  b[0] = static_cast<uint8_t>(id + 5);
  b[1] = 2;
  return b;
}

// The report request that starts it.
Bytes report(uint8_t id, uint16_t rate, bool accel) {
  Bytes b = report_stop(id);
  b[1] = 1;
  put(b, 2, rate);
  b[4] = 1;
  b[8] = 1;
  b[12] = id;
  b[15] = 3;
  b[212] = 1;
  b[216] = 1;
  b[220] = accel ? 1 : 2;
  if (accel) b[232] = b[236] = b[240] = 1;
  return b;
}

using RawDataTest = RequestTest;

TEST_F(RawDataTest, ReportRequestsOfTheSensorManager) {
  const std::tuple<int32_t, Bytes, int32_t> cases[] = {
      {0, report(0, 100, true), 0},
      {2, report(20, 50, false), 20},
      {7, report(0xff, 100, false), -1},  // no sensor: report id 4, SensorId 0xFF
      {8, report(20, 100, false), 20},    // the magnetometer's id, at the common rate
  };
  for (const auto& [sensor_type, body, logged_id] : cases) {
    command(1, {sensor_type});
    if (sensor_type == 2) next();  // the calibration reset
    EXPECT_THAT(next(), IsRequest(0, 2, 2, body));
    EXPECT_EQ(main_lines().back(),
              "get_raw_data: sensor_type = " + std::to_string(logged_id) + " txn_id = 2\n");
  }
  EXPECT_TRUE(no_frame());  // a start answers nothing
}

TEST_F(RawDataTest, LightSensorRequestsAndStopReplies) {
  const std::tuple<uint16_t, int32_t, uint32_t, int32_t> cases[] = {
      {1, 4, 60, 10000}, {3, 4, 62, 100000}, {1, 5, 50, 10000}, {3, 5, 52, 100000}};
  for (const auto& [number, sensor_type, request_id, data] : cases) {
    command(number, {sensor_type});
    EXPECT_THAT(next(), IsRequest(44, 32, 123, daf_request(kLightSuid, request_id, words({data}))));
    const std::string name = number == 1 ? "get_raw_data" : "stop_raw_data";
    EXPECT_THAT(last_lines(2),
                ElementsAre(name + " sensor_type:" + std::to_string(sensor_type) + "\n",
                            name + ": sensor_type = 40 txn_id = 123\n"));
    if (number == 3) {
      EXPECT_EQ(frame(3), word_frame(3, {5, 0}));
    }
  }

  command(3, {2});
  EXPECT_EQ(next().body, report_stop(20));
  EXPECT_EQ(frame(3), word_frame(3, {2, 0}));
  command(3, {10});
  EXPECT_EQ(next().body, report_stop(0xff));
  EXPECT_EQ(frame(3), word_frame(3, {-1, 0}));
}

TEST_F(RawDataTest, MagnetometerResetsItsCalibrationOncePerStreamAndKeepsFuseRomSensitivities) {
  // One magnetometer sample of 1.0 on each axis, as the kernel gets it: y, x and -z, each
  // divided by its sensitivity.
  auto sample = [this](int16_t v0, int16_t v1, int16_t v2) {
    sim->indicate(Header{0, 3, 0, 0},
                  kestrel_sim::sample_indication_body(20, 0, 65536, 65536, 65536));
    const int16_t v[6] = {v0, v1, v2};
    Bytes p = words({2});
    p.insert(p.end(), reinterpret_cast<const uint8_t*>(v), reinterpret_cast<const uint8_t*>(v + 6));
    EXPECT_EQ(frame(2), daemon_frame(2, p));
  };
  command(1, {2});
  EXPECT_THAT(last_lines(3),
              ElementsAre("get_raw_data: Reset Mag Cal IN", "get_raw_data: Reset Mag Cal OUT",
                          "get_raw_data: sensor_type = 20 txn_id = 2\n"));
  sample(666, 666, -666);

  // A fuse-ROM read that is not sent to the kernel sets the sensitivities: word / 128 + 1.
  answer_tests(20, 9, {64, -64, 0});
  get_mag_register_data(8, 0);
  sim->set_request_hook(nullptr);
  command(1, {2});
  command(3, {2});
  command(1, {2});
  sample(1333, 444, -666);

  // Start, fuse-ROM read, start, stop, start: the reset goes out before the first start and
  // after the stop.
  std::vector<std::pair<int32_t, uint8_t>> seen;  // msg_id and the second body byte
  for (int i = 0; i < 7; ++i) {
    const Request r = next();
    seen.emplace_back(r.header.msg_id, r.body.at(1));
  }
  EXPECT_THAT(seen, ElementsAre(Pair(38, 20), Pair(2, 1), Pair(13, 0), Pair(2, 1), Pair(2, 2),
                                Pair(38, 20), Pair(2, 1)));  // reset, start, fuse ROM, ...
  EXPECT_TRUE(kernel->next_frame_of_type(11, 100ms) == std::nullopt);
}

TEST_F(RawDataTest, AStreamOfTheHealthyPhoneReachesTheKernelUntilItsStop) {
  sim->set_healthy(true);
  command(1, {0});
  std::optional<Frame> f = kernel->next_frame(2000ms);
  ASSERT_TRUE(f && f->type == 2 && f->len == 32u && load_i32(f->payload.data(), 0) == 0)
      << "no accelerometer sample";
  command(3, {0});
  while ((f = kernel->next_frame(2000ms)) && f->type == 2) {
  }
  ASSERT_TRUE(f.has_value());
  EXPECT_EQ(f->raw, word_frame(3, {0, 0}));
  // Samples already on their way may follow the reply, but the stream itself has ended: at
  // 100 Hz, fifty more would take half a second without a pause.
  for (int late = 0; kernel->next_frame(300ms); ++late) ASSERT_LT(late, 50) << "the stream runs on";
}

}  // namespace
}  // namespace request_test
