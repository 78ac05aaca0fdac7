// The sensor1 library under concurrent use: writers on several threads sharing one connection
// while the library thread delivers a flood of indications, and a close racing the deliveries.
#include <gtest/gtest.h>
#include <string.h>

#include <atomic>
#include <memory>
#include <thread>

#include "byte_order.h"
#include "sensor1.h"
#include "sensor1_host.h"
#include "test_env.h"
#include "tests/sim/sensor1_recorder.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::Request;
using kestrel_sim::Simulator;
using std::chrono_literals::operator""s;

constexpr int kWriters = 4;
constexpr int kWritesEach = 250;

TEST(Sensor1Race, WritersShareAConnectionWhileIndicationsFlowBack) {
  Simulator sim(test_socket_path());
  // Every request is answered at once with an indication that echoes its body.
  sim.set_request_hook([](Simulator& s, const Request& r) {
    s.indicate({0, 3, 0, r.header.txn_id}, r.body);
  });
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  ASSERT_EQ(rec.open(0, &h), 0);

  std::atomic<int> failures{0};
  std::vector<std::thread> writers;
  for (int w = 0; w < kWriters; ++w) {
    writers.emplace_back([&, w] {
      for (int i = 0; i < kWritesEach; ++i) {
        void* body = nullptr;
        if (sensor1_alloc_msg_buf(h, 8, &body) != 0) {
          ++failures;
          continue;
        }
        store_u32(body, 0, static_cast<uint32_t>(w));
        store_u32(body, 4, static_cast<uint32_t>(i));
        sensor1_msg_header_s hdr{0, 13, 8, static_cast<uint8_t>(w)};
        if (sensor1_write(h, &hdr, body) != 0) ++failures;
      }
    });
  }
  for (std::thread& t : writers) t.join();
  EXPECT_EQ(failures.load(), 0);

  // Every record arrived whole, and each writer's in its own order.
  std::vector<int> next(kWriters, 0);
  for (int n = 0; n < kWriters * kWritesEach; ++n) {
    auto r = sim.next_request(5s);
    ASSERT_TRUE(r) << "only " << n << " requests arrived";
    ASSERT_EQ(r->body.size(), 8u);
    const uint32_t w = load_u32(r->body.data(), 0);
    ASSERT_LT(w, static_cast<uint32_t>(kWriters));
    EXPECT_EQ(r->header.txn_id, w);
    EXPECT_EQ(load_u32(r->body.data(), 4), static_cast<uint32_t>(next[w]++));
  }
  ASSERT_TRUE(rec.wait_for(kWriters * kWritesEach, 10s));
  for (const Delivery& d : rec.deliveries()) {
    ASSERT_EQ(d.type, 2);
    ASSERT_EQ(d.body.size(), 8u);
    EXPECT_EQ(d.header.txn_id, load_u32(d.body.data(), 0));
  }
  EXPECT_EQ(sensor1_close(h), 0);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
}

TEST(Sensor1Race, CloseRacesDeliveriesAndWritesWithoutHarm) {
  Simulator sim(test_socket_path());
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  ASSERT_EQ(rec.open(1, &h), 0);
  ASSERT_TRUE(sim.wait_for_connection(2s));

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
      if (was_closed) {
        EXPECT_EQ(r, SENSOR1_HOST_EINVAL);
      }
    }
  });
  rec.wait_for(100, 5s);
  EXPECT_EQ(sensor1_close(h), 0);
  closed = true;
  const size_t before = rec.deliveries(1).size();
  flood.join();
  writer.join();
  EXPECT_TRUE(sim.wait_for_disconnect(2s));

  // The library thread still serves new connections, and the closed one heard nothing more
  // than the delivery that may have been under way when the close returned.
  sensor1_handle_s* h2 = nullptr;
  ASSERT_EQ(rec.open(2, &h2), 0);
  ASSERT_TRUE(sim.wait_for_connection(2s));
  sim.respond({0, 64, 0, 0}, {0});
  ASSERT_TRUE(rec.wait_for(1, 5s, 2));
  EXPECT_LE(rec.deliveries(1).size(), before + 1);
  for (const Delivery& d : rec.deliveries(1)) EXPECT_NE(d.type, 250);
  EXPECT_EQ(sensor1_close(h2), 0);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
}

}  // namespace
