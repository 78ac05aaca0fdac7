// The scripted simulator as the daemon's tests use it: connections numbered and addressed, and
// a clean shutdown.
#include <gtest/gtest.h>
#include <unistd.h>

#include <memory>

#include "sensor1.h"
#include "sensor1_host.h"
#include "test_env.h"
#include "tests/sim/sensor1_recorder.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::Request;
using kestrel_sim::Simulator;
using Bytes = std::vector<uint8_t>;
using std::chrono_literals::operator""s;

int write(sensor1_handle_s* h, int32_t msg_id, const Bytes& body) {
  void* buf = nullptr;
  if (sensor1_alloc_msg_buf(h, static_cast<uint16_t>(body.size()), &buf) != 0) return -1;
  std::copy(body.begin(), body.end(), static_cast<uint8_t*>(buf));
  sensor1_msg_header_s hdr{0, msg_id, static_cast<uint16_t>(body.size()), 4};
  return sensor1_write(h, &hdr, buf);
}

TEST(SimulatorTest, ConnectionsAreNumberedAndAddressable) {
  Simulator sim(test_socket_path());
  Sensor1Recorder rec;
  sensor1_handle_s* a = nullptr;
  sensor1_handle_s* b = nullptr;
  ASSERT_EQ(rec.open(1, &a), 0);
  ASSERT_EQ(write(a, 11, {1}), 0);
  ASSERT_TRUE(sim.next_request(2s));
  ASSERT_EQ(rec.open(2, &b), 0);  // a stays open; b is the current connection now
  EXPECT_EQ(sim.current_connection(), 2);
  ASSERT_EQ(write(b, 11, {2}), 0);
  auto r = sim.next_request(2s);
  ASSERT_TRUE(r);
  EXPECT_EQ(r->connection, 2);
  EXPECT_EQ(r->body, Bytes{2});
  ASSERT_EQ(write(a, 11, {3}), 0);
  r = sim.next_request(2s);
  ASSERT_TRUE(r);
  EXPECT_EQ(r->connection, 1);
  EXPECT_EQ(r->header.msg_id, 11);
  EXPECT_EQ(r->header.msg_size, 1);
  EXPECT_EQ(r->header.txn_id, 4);
  EXPECT_EQ(r->body, Bytes{3});
  const std::vector<Request> all = sim.requests();
  ASSERT_EQ(all.size(), 3u);
  EXPECT_EQ(all[0].connection, 1);
  EXPECT_EQ(all[1].connection, 2);
  EXPECT_EQ(all[2].connection, 1);

  EXPECT_TRUE(sim.respond_to(1, {0, 64, 0, 0}, {10}));
  sim.respond({0, 64, 0, 0}, {20});
  ASSERT_TRUE(rec.wait_for(1, 2s, 1));
  ASSERT_TRUE(rec.wait_for(1, 2s, 2));
  EXPECT_EQ(rec.deliveries(1)[0].body, Bytes{10});
  EXPECT_EQ(rec.deliveries(2)[0].body, Bytes{20});

  sim.clear_requests();
  EXPECT_TRUE(sim.requests().empty());
  EXPECT_EQ(sensor1_close(a), 0);
  EXPECT_EQ(sensor1_close(b), 0);
  EXPECT_TRUE(sim.wait_for_disconnect(2s));
  EXPECT_FALSE(sim.indicate_to(1, {0, 3, 0, 0}, {}));
  EXPECT_EQ(sim.opened_connections(), 2);
}

}  // namespace
