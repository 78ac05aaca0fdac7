// SPDX-License-Identifier: Apache-2.0
// The sensor1 library under concurrent use: writers on several threads sharing one connection
// while the library thread delivers a flood of indications, and a close racing the deliveries.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "sensor1_recorder.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::Simulator;
using std::chrono_literals::operator""s;

TEST(Sensor1Race, WritersShareAConnectionWhileIndicationsFlowBack) {
  constexpr unsigned kWriters = 4, kEach = 250;
  Simulator sim(test_socket_path());
  // Every request is answered at once with an indication that echoes its body.
  sim.set_request_hook([](Simulator& s, const kestrel_sim::Request& r) {
    s.indicate({0, 3, 0, r.header.txn_id}, r.body);
  });
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  ASSERT_EQ(rec.open(&h), 0);
  std::vector<std::thread> writers;
  for (uint8_t w = 0; w < kWriters; ++w) {
    writers.emplace_back([&, w] {
      for (uint8_t i = 0; i < kEach; ++i) EXPECT_EQ(write_request(h, {0, 13, 0, w}, {w, i}), 0);
    });
  }
  for (std::thread& t : writers) t.join();
  // Every record arrived whole, and each writer's in its own order; so did the indications.
  std::vector<uint8_t> next(kWriters, 0);
  for (unsigned n = 0; n < kWriters * kEach; ++n) {
    const auto r = sim.next_request(5s);
    ASSERT_TRUE(r && r->body.size() == 2 && r->body[0] < kWriters) << "request " << n;
    EXPECT_EQ(r->header.txn_id, r->body[0]);
    EXPECT_EQ(r->body[1], next[r->body[0]]++);
  }
  ASSERT_TRUE(rec.wait_for(kWriters * kEach, 10s));
  for (const Delivery& d : rec.deliveries()) {
    EXPECT_TRUE(d.type == 2 && d.body.size() == 2 && d.body[0] == d.header.txn_id) << summary(d);
  }
  EXPECT_EQ(sensor1_close(h), 0);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
}

TEST(Sensor1Race, CloseRacesDeliveriesAndWritesWithoutHarm) {
  Simulator sim(test_socket_path());
  Sensor1Recorder closed_one, later;
  sensor1_handle_s *h = nullptr, *h2 = nullptr;
  ASSERT_EQ(closed_one.open(&h), 0);
  std::atomic<bool> closed{false};
  std::thread flood([&] {
    for (int i = 0; i < 2000; ++i) sim.indicate({0, 3, 0, 0}, std::vector<uint8_t>(24, 1));
  });
  std::thread writer([&] {
    // Writes go on until the close; after it every one is refused and its body stays here.
    for (int i = 0; i < 2000; ++i) {
      void* body = sensor1_host_alloc_body(4);
      sensor1_msg_header_s hdr{0, 64, 4, 0};
      const bool was_closed = closed.load();
      const int r = sensor1_write(h, &hdr, body);
      if (r != 0) sensor1_free_msg_buf(nullptr, body);
      EXPECT_TRUE(!was_closed || r == SENSOR1_HOST_EINVAL) << r;
    }
  });
  closed_one.wait_for(100, 5s);
  EXPECT_EQ(sensor1_close(h), 0);
  closed = true;
  const size_t before = closed_one.deliveries().size();
  flood.join();
  writer.join();
  EXPECT_TRUE(sim.wait_for_disconnect(2s));

  // The library thread still serves new connections, and the closed one heard nothing more once
  // the close had returned: it waited for the delivery under way.
  ASSERT_EQ(later.open(&h2), 0);
  sim.respond({0, 64, 0, 0}, {0});
  ASSERT_TRUE(later.wait_for(1));
  EXPECT_EQ(write_request(h, {0, 64, 0, 0}, {1}), SENSOR1_HOST_EINVAL) << "not on the new one";
  EXPECT_EQ(closed_one.deliveries().size(), before);
  for (const Delivery& d : closed_one.deliveries()) EXPECT_NE(d.type, 250);
  EXPECT_EQ(sensor1_close(h2), 0);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
}

}  // namespace
