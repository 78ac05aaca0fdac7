// The simulator: the healthy phone's answers to the daemon, and scripted connections, numbered
// and addressed.
#include <gtest/gtest.h>

#include "byte_order.h"
#include "sensor1_recorder.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace {

using Bytes = std::vector<uint8_t>;
using Strings = std::vector<std::string>;
using kestrel_sim::Simulator;

// A self test and a register dump byte for byte, then a stream: samples until the stop's
// response, and after it nothing more of the stream: the status poll written after the stop is
// answered next, and no sample follows in 30 periods.
TEST(HealthyPhoneTest, AnswersTestsDumpsAndStreams) {
  Simulator sim(test_socket_path(), true);
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  ASSERT_EQ(rec.open(&h), 0);
  ASSERT_EQ(write_request(h, {0, 13, 0, 4}, {0, 0, 0, 0, 6, 0, 0, 0, 1, 1, 0, 0}), 0);
  Bytes dump(288, 0);  // daf request 100015: the magnetometer's registers
  store_u32(dump.data(), 16, 100015);
  dump[20] = 1;
  ASSERT_EQ(write_request(h, {44, 32, 0, 171}, dump), 0);
  // The indication: SensorID 0, TestType 6, result 0, no error, the words from byte 20 on; the
  // dump's response: result 0, error 0, registers 0x00 to 0x7f from byte 12.
  ASSERT_TRUE(rec.wait_for(3));
  EXPECT_EQ(
      rec.summaries(),
      (Strings{"1 [0 13 2 4] 0000",
               "2 [0 13 84 4] 0000000006" + std::string(30, '0') +
                   "010000000c000000f8ffffffeb0300000100000036010000d9feffff7c010000" +
                   std::string(64, '0'),
               "1 [44 32 140 171] " + std::string(24, '0') + "4809" + std::string(28, '0') +
                   "012c00e4ff8afe0018" + std::string(48, '0') + "08" + std::string(156, '0')}));

  Bytes report(272, 0);  // report 5 of the accelerometer at 100 Hz
  report[0] = 5;
  report[1] = 1;
  store_u16(report.data(), 2, 100);
  ASSERT_EQ(write_request(h, {0, 2, 0, 2}, report), 0);
  ASSERT_TRUE(rec.wait_for(6));
  report[1] = 2;  // delete
  ASSERT_EQ(write_request(h, {0, 2, 0, 2}, report), 0);
  ASSERT_EQ(write_request(h, {0, 11, 0, 6}, {0xFF, 0, 0}), 0);
  ASSERT_TRUE(eventually([&] { return rec.summaries().back() == "1 [0 11 3 6] 000000"; }));
  EXPECT_FALSE(rec.wait_for(rec.deliveries().size() + 1, std::chrono::milliseconds(300)));
  const Strings s = rec.summaries();
  const std::string response = "1 [0 2 12 2] 000000000000000000000000";
  EXPECT_EQ(s[3], response) << "samples first";
  EXPECT_EQ(s[s.size() - 2], response) << "a sample came after the stream's stop was answered";
  const std::vector<Delivery> d = rec.deliveries();
  for (size_t i = 4; i + 2 < d.size(); ++i) {  // the accelerometer lying flat: 9.81 m/s^2 on z
    EXPECT_EQ(summary(d[i]).substr(0, 18), "2 [0 3 24 0] 00000");
    EXPECT_NEAR(load_i32(d[i].body.data(), 20), 642689, 1300);  // Q16
  }
  EXPECT_EQ(sensor1_close(h), 0);
}

TEST(SimulatorTest, ConnectionsAreNumberedAndAddressable) {
  Simulator sim(test_socket_path());
  Sensor1Recorder one, two;
  sensor1_handle_s *a = nullptr, *b = nullptr;
  ASSERT_EQ(one.open(&a), 0);
  ASSERT_EQ(two.open(&b), 0);  // a stays open; b is the current connection now
  ASSERT_EQ(write_request(b, {0, 11, 0, 4}, {2}), 0);
  ASSERT_TRUE(sim.next_request(std::chrono::seconds(2)));
  ASSERT_EQ(write_request(a, {0, 12, 0, 5}, {1}), 0);
  ASSERT_TRUE(sim.next_request(std::chrono::seconds(2)));
  std::vector<std::pair<int, int>> got;
  for (const kestrel_sim::Request& r : sim.requests())
    got.push_back({r.connection, r.header.msg_id});
  EXPECT_EQ(got, (std::vector<std::pair<int, int>>{{2, 11}, {1, 12}}));
  EXPECT_TRUE(sim.respond_to(1, {0, 64, 0, 0}, {10}));
  sim.respond({0, 64, 0, 0}, {20});
  ASSERT_TRUE(one.wait_for(1) && two.wait_for(1));
  EXPECT_EQ(one.summaries(), Strings{"1 [0 64 1 0] 0a"});
  EXPECT_EQ(two.summaries(), Strings{"1 [0 64 1 0] 14"});
  EXPECT_EQ(sensor1_close(a), 0);
  EXPECT_EQ(sensor1_close(b), 0);
  EXPECT_TRUE(sim.wait_for_disconnect(std::chrono::seconds(2)));
  EXPECT_FALSE(sim.indicate_to(1, {0, 3, 0, 0}, {}));
  EXPECT_EQ(sim.opened_connections(), 2);
}

}  // namespace
