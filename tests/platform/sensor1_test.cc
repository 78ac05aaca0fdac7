// SPDX-License-Identifier: Apache-2.0
// The sensor1 library of the host build against a scripted sensor processor (the simulator, or a
// raw socket peer where the bytes on the wire matter).
#include <gtest/gtest.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <memory>

#include "daemon_frames.h"
#include "log_capture.h"
#include "sensor1_recorder.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::Simulator;
using std::chrono_literals::operator""s;
using std::chrono_literals::operator""ms;

class Sensor1Test : public ::testing::Test {
 protected:
  void TearDown() override {
    for (sensor1_handle_s* h : to_close) sensor1_close(h);
    sim.reset();
    EXPECT_EQ(sensor1_host_outstanding_bodies(), 0) << "a body was not released";
  }

  // A connection of r, closed at the end of the test.
  sensor1_handle_s* open(Sensor1Recorder& r) {
    to_close.push_back(nullptr);
    EXPECT_EQ(r.open(&to_close.back()), 0);
    return to_close.back();
  }

  // alloc and write on h fail with result, the write leaving its body to the caller; a close
  // fails too, but for an ended connection's handle.
  void expect_refused(sensor1_handle_s* h, int result) {
    void* buf = reinterpret_cast<void*>(1);
    EXPECT_EQ(sensor1_alloc_msg_buf(h, 4, &buf), result);
    EXPECT_EQ(buf, nullptr);
    void* body = sensor1_host_alloc_body(4);
    sensor1_msg_header_s hdr{0, 13, 4, 4};
    EXPECT_EQ(sensor1_write(h, &hdr, body), result);
    EXPECT_EQ(sensor1_host_outstanding_bodies(), 1) << "a refused write takes no body";
    EXPECT_EQ(sensor1_free_msg_buf(nullptr, body), 0);  // any handle releases, a null one too
    EXPECT_EQ(sensor1_close(h), result == SENSOR1_HOST_EPIPE ? 0 : result);
  }

  Lines lines() const { return log.messages("libsensor1"); }

  LogCapture log;
  std::unique_ptr<Simulator> sim = std::make_unique<Simulator>(test_socket_path());
  Sensor1Recorder rec;
  std::vector<sensor1_handle_s*> to_close;
};

// Refused opens are driven through the daemon's reopen tries; here, what a connection refuses.
TEST_F(Sensor1Test, BadWritesAndClosedHandlesAreRefused) {
  const long stale_before = sensor1_host_stale_handle_calls();
  sensor1_handle_s* h = nullptr;
  ASSERT_EQ(rec.open(&h), 0);

  sensor1_msg_header_s hdr{0, 13, 4, 4};
  EXPECT_EQ(sensor1_write(h, nullptr, nullptr), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(sensor1_write(h, &hdr, nullptr), SENSOR1_HOST_EINVAL) << "size 4 without a body";
  EXPECT_EQ(sensor1_close(h), 0);
  EXPECT_TRUE(sim->wait_for_disconnect(2s));
  expect_refused(h, SENSOR1_HOST_EINVAL);
  expect_refused(nullptr, SENSOR1_HOST_EINVAL);
  // Each call on the closed handle is counted and logged; the empty handle is no closed one.
  auto stale = [h](const std::string& call) {
    char handle[32];
    snprintf(handle, sizeof handle, "%p", static_cast<void*>(h));
    return call + " on a closed handle " + handle;
  };
  EXPECT_EQ(lines(), (Lines{"open -> 0", "close -> 0", stale("alloc"), stale("write"),
                            stale("close"), "close -> 22", "close -> 22"}));
  EXPECT_EQ(sensor1_host_stale_handle_calls() - stale_before, 3);
  EXPECT_TRUE(rec.deliveries().empty()) << "a close by the daemon is no broken pipe";
}

TEST_F(Sensor1Test, RecordsOnTheWireAreByteExact) {
  sim.reset();
  const int listener = socket(AF_UNIX, SOCK_STREAM, 0);
  sockaddr_un addr{AF_UNIX, {}};
  strncpy(addr.sun_path, test_socket_path().c_str(), sizeof addr.sun_path - 1);
  ASSERT_EQ(bind(listener, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  listen(listener, 1);
  sensor1_handle_s* h = nullptr;
  std::future<int> opened = std::async(std::launch::async, [&] { return rec.open(&h); });
  const int peer = accept(listener, nullptr, nullptr);
  const timeval tv = {5, 0};
  setsockopt(peer, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  auto read = [&](size_t n) {
    Bytes b(n);
    return recv(peer, b.data(), n, MSG_WAITALL) == static_cast<ssize_t>(n) ? b : Bytes{};
  };
  EXPECT_EQ(read(5), (Bytes{1, 0, 0, 0, 1}));  // OPEN
  // OPEN_RESULT 0 and a RESPONSE in one segment: the response belongs to the callback.
  const Bytes records = {5, 0, 0, 0, 64, 0, 0, 0, 0, 15, 0, 0, 0, 65,
                         0, 0, 0, 0, 11, 0, 0, 0, 2, 0,  6, 0, 7, 0};
  send(peer, records.data(), records.size(), 0);
  ASSERT_EQ(opened.get(), 0);
  to_close.push_back(h);
  ASSERT_TRUE(rec.wait_for(1));
  EXPECT_EQ(rec.summaries(), Lines{"1 [0 11 2 6] 0700"});

  // A write: header fields little-endian, the signed msg_id included, then the body.
  EXPECT_EQ(write_request(h, {44, -2, 0, 169}, {0xAA, 0x01, 0xFF}), 0);
  EXPECT_EQ(read(20), (Bytes{16,   0,    0,    0, 2, 44,  0, 0,    0,    0xFE,
                             0xFF, 0xFF, 0xFF, 3, 0, 169, 0, 0xAA, 0x01, 0xFF}));
  close(peer);
  close(listener);
}

// Responses, indications and the broken pipe reach the callback in every daemon test that runs
// the library; here, the ended connection's handle.
TEST_F(Sensor1Test, AnEndedConnectionRefusesWithABrokenPipe) {
  sensor1_handle_s* h = open(rec);
  sim->drop_connection();
  ASSERT_TRUE(rec.wait_for(1));
  expect_refused(h, SENSOR1_HOST_EPIPE);
  EXPECT_EQ(rec.summaries(), Lines{"250 [0 0 0 0] no body"});
  EXPECT_EQ(lines(), (Lines{"open -> 0", "connection ended, BROKEN_PIPE", "close -> 0"}));
}

// A callback may block, close its own connection and open another. While the blocker's callback
// blocks the library's thread, two indications for a queue up and are then read together; the
// callback of the first closes a, so the second is never delivered.
TEST_F(Sensor1Test, CallbackMayBlockCloseItsConnectionAndOpenAnother) {
  std::atomic<int> stage{0};
  sensor1_handle_s *a = nullptr, *b = nullptr;
  Sensor1Recorder second;
  Sensor1Recorder first([&](const Delivery&) {
    EXPECT_EQ(sensor1_close(a), 0);
    EXPECT_EQ(second.open(&b), 0);
  });
  Sensor1Recorder blocker([&](const Delivery&) {
    stage = 1;
    EXPECT_TRUE(eventually([&] { return stage == 2; }));
  });
  ASSERT_EQ(first.open(&a), 0);  // connection 1
  open(blocker);
  sim->indicate({0, 13, 0, 4}, {9});  // to the blocker's connection, the current one
  ASSERT_TRUE(eventually([&] { return stage == 1; }));
  EXPECT_TRUE(sim->indicate_to(1, {0, 13, 0, 4}, {1}) && sim->indicate_to(1, {0, 13, 0, 4}, {2}));
  stage = 2;
  ASSERT_TRUE(first.wait_for(1));
  to_close.push_back(b);
  sim->respond({0, 64, 0, 0}, {7});  // to b, the current connection
  ASSERT_TRUE(second.wait_for(1));
  EXPECT_EQ(first.summaries(), Lines{"2 [0 13 1 4] 01"});
  EXPECT_EQ(second.summaries(), Lines{"1 [0 64 1 0] 07"});
  EXPECT_EQ(lines(), (Lines{"open -> 0", "open -> 0", "close -> 0", "open -> 0"}));
}

// A broken pipe sent while the open's answer is held reaches the callback before sensor1_open
// returns; a close from another thread while that callback runs waits for it, and says so first.
TEST_F(Sensor1Test, RecordAheadOfTheOpenAnswerReachesTheCallbackDuringTheOpen) {
  std::promise<void> called;
  std::atomic<bool> let_go{false};
  Sensor1Recorder r([&](const Delivery&) {
    called.set_value();
    EXPECT_TRUE(eventually([&] { return let_go.load(); }));
  });
  sim->hold_opens(5000ms, 1);
  sensor1_handle_s* h = nullptr;
  auto opened = std::async(std::launch::async, [&] { return r.open(&h); });
  ASSERT_TRUE(sim->wait_for_held_open(2s));
  ASSERT_TRUE(sim->callback_to_held_open(250, true, false, {}, {}));
  ASSERT_EQ(called.get_future().wait_for(2s), std::future_status::ready);
  EXPECT_NE(opened.wait_for(0s), std::future_status::ready) << "the open has returned";
  sim->release_held_opens();
  ASSERT_EQ(opened.get(), 0);
  auto closed = std::async(std::launch::async, [&] { return sensor1_close(h); });
  EXPECT_TRUE(log.wait_for("close waits for a callback", 2000ms, 1, "libsensor1"));
  let_go = true;
  EXPECT_EQ(closed.get(), 0);
  EXPECT_EQ(r.summaries(), Lines{"250 [0 0 0 0] no body"});
  EXPECT_EQ(lines(), (Lines{"open -> 0", "close waits for a callback", "close -> 0"}));
}

}  // namespace
