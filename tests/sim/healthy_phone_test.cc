// The healthy phone answers the daemon's requests: a few answers byte for byte, and streams that
// start, deliver and stop.
#include <gtest/gtest.h>
#include <string.h>

#include <memory>

#include "byte_order.h"
#include "sensor1.h"
#include "sensor1_host.h"
#include "test_env.h"
#include "tests/sim/sensor1_recorder.h"
#include "tools/sim/healthy_phone.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::Simulator;
using Bytes = std::vector<uint8_t>;
using std::chrono_literals::operator""s;

class HealthyPhoneTest : public ::testing::Test {
 protected:
  void SetUp() override {
    sim = std::make_unique<Simulator>(test_socket_path(), true);
    ASSERT_EQ(rec.open(0, &h), 0);
  }
  void TearDown() override {
    EXPECT_EQ(sensor1_close(h), 0);
    sim.reset();
    EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
  }

  void write(uint32_t service, int32_t msg_id, uint8_t txn, const Bytes& body) {
    void* buf = nullptr;
    ASSERT_EQ(sensor1_alloc_msg_buf(h, static_cast<uint16_t>(body.size()), &buf), 0);
    memcpy(buf, body.data(), body.size());
    sensor1_msg_header_s hdr{service, msg_id, static_cast<uint16_t>(body.size()), txn};
    ASSERT_EQ(sensor1_write(h, &hdr, buf), 0);
  }

  // Waits for the delivery number n (from 0) and returns it.
  Delivery delivery(size_t n) {
    EXPECT_TRUE(rec.wait_for(n + 1)) << "no delivery " << n;
    const std::vector<Delivery> d = rec.deliveries();
    return n < d.size() ? d[n] : Delivery{};
  }

  // Indexes of the response to the stop (msg_id stop_msg) and of the status poll's response
  // that follows it.
  std::pair<size_t, size_t> stop_and_poll(int32_t stop_msg) {
    size_t stop_at = 0;
    for (size_t n = 1; n < 5000; ++n) {
      const Delivery d = delivery(n);
      if (d.type == 0) break;  // none came
      if (d.type == 1 && d.header.msg_id == stop_msg) stop_at = n;
      if (d.type == 1 && d.header.msg_id == 11) return {stop_at, n};
    }
    ADD_FAILURE() << "the status poll was not answered";
    return {0, 0};
  }

  static Bytes words_at(Bytes b, size_t offset, const std::vector<int32_t>& w) {
    for (size_t i = 0; i < w.size(); ++i) store_i32(b.data(), offset + 4 * i, w[i]);
    return b;
  }

  static Bytes daf_request(uint32_t id) {
    Bytes b(288, 0);
    store_u32(b.data(), 16, id);
    b[20] = 1;
    return b;
  }

  static Bytes report_request(uint8_t report_id, uint8_t action, uint16_t rate, uint8_t sensor) {
    Bytes b(272, 0);
    b[0] = report_id;
    b[1] = action;
    store_u16(b.data(), 2, rate);
    b[12] = sensor;
    return b;
  }

  std::unique_ptr<Simulator> sim;
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
};

TEST_F(HealthyPhoneTest, SelfTestIsAResponseThenAPassedIndication) {
  write(0, 13, 4, {0, 0, 0, 0, 6, 0, 0, 0, 1, 1, 0, 0});
  ASSERT_TRUE(rec.wait_for(2));
  EXPECT_EQ(summary(rec.deliveries()[0]), "1 [0 13 2 4] 0000");
  const Delivery ind = rec.deliveries()[1];
  EXPECT_EQ(ind.type, 2);
  EXPECT_EQ(ind.header.msg_id, 13);
  Bytes expected(84, 0);
  expected[4] = 6;  // TestType; SensorID 0, result 0, no error code
  expected = words_at(expected, 20, {1, 12, -8, 1003, 1, 310, -295, 380});
  EXPECT_EQ(ind.body, expected);
}

TEST_F(HealthyPhoneTest, RegisterDumpCarriesTheChipsRegisters) {
  write(44, 32, 171, daf_request(100015));  // magnetometer dump
  Bytes expected(140, 0);      // result 0, error 0, registers 0x00 to 0x7f from byte 12
  expected[12 + 0x00] = 0x48;  // WIA1
  expected[12 + 0x01] = 0x09;  // WIA2
  expected[12 + 0x10] = 0x01;
  expected[12 + 0x11] = 0x2C;
  expected[12 + 0x13] = 0xE4;
  expected[12 + 0x14] = 0xFF;
  expected[12 + 0x15] = 0x8A;
  expected[12 + 0x16] = 0xFE;
  expected[12 + 0x18] = 0x18;
  expected[12 + 0x31] = 0x08;
  Delivery want;
  want.type = 1;
  want.has_header = want.has_body = true;
  want.header = {44, 32, 140, 171};
  want.body = expected;
  EXPECT_EQ(summary(delivery(0)), summary(want));
}

// Samples of a stream until its stop's response; after it nothing more of that stream comes:
// the status poll that follows is answered with no sample in between.
TEST_F(HealthyPhoneTest, AccelerometerStreamStartsDeliversAndStops) {
  write(0, 2, 2, report_request(5, 1, 100, 0));
  EXPECT_EQ(summary(delivery(0)), "1 [0 2 12 2] 000000000000000000000000") << "samples first";
  ASSERT_TRUE(rec.wait_for(4));
  for (const Delivery& s : rec.deliveries()) {
    if (s.type != 2) continue;
    EXPECT_EQ(s.header.msg_id, 3);
    ASSERT_EQ(s.body.size(), 24u);
    EXPECT_EQ(s.body[8], 0);  // sensor id
    EXPECT_EQ(s.body[9], 0);  // primary data
    // Lying flat: about 0.1, -0.2 and 9.81 m/s^2 in Q16.
    EXPECT_NEAR(load_i32(s.body.data(), 12), 6554, 1300);
    EXPECT_NEAR(load_i32(s.body.data(), 16), -13107, 1300);
    EXPECT_NEAR(load_i32(s.body.data(), 20), 642689, 1300);
  }
  write(0, 2, 2, report_request(5, 2, 0, 0));
  write(0, 11, 6, {0xFF, 0, 0});
  const auto [stop_at, status_at] = stop_and_poll(2);
  EXPECT_EQ(status_at, stop_at + 1) << "a sample came after the stream's stop was answered";
}

}  // namespace
