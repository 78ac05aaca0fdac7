// The sensor1 library of the host build against a scripted sensor processor (the simulator, or a
// raw socket peer where the bytes on the wire matter).
#include <gtest/gtest.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <thread>

#include "log_capture.h"
#include "sensor1.h"
#include "sensor1_host.h"
#include "test_env.h"
#include "tests/sim/sensor1_recorder.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::FaultOp;
using kestrel_sim::Header;
using kestrel_sim::Request;
using kestrel_sim::Simulator;
using Bytes = std::vector<uint8_t>;
using std::chrono_literals::operator""s;

sockaddr_un socket_address() {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, test_socket_path().c_str(), sizeof addr.sun_path - 1);
  return addr;
}

// A peer that speaks the wire protocol by hand, for byte-exact checks.
class RawPeer {
 public:
  RawPeer() : listen_fd_(socket(AF_UNIX, SOCK_STREAM, 0)) {
    sockaddr_un addr = socket_address();
    bind(listen_fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
    listen(listen_fd_, 4);
  }
  ~RawPeer() {
    close(fd_);
    close(listen_fd_);
    unlink(test_socket_path().c_str());
  }
  // Accepts one connection and returns the first bytes it sent (the OPEN record).
  Bytes accept_one() {
    fd_ = accept(listen_fd_, nullptr, nullptr);
    timeval tv = {5, 0};
    setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
    return read(5);
  }
  Bytes read(size_t n) {
    Bytes b(n);
    ssize_t r = 0;
    for (size_t got = 0; got < n; got += static_cast<size_t>(r)) {
      if ((r = recv(fd_, b.data() + got, n - got, 0)) <= 0)
        return Bytes(b.begin(), b.begin() + got);
    }
    return b;
  }
  void send_bytes(const Bytes& b) {
    EXPECT_EQ(send(fd_, b.data(), b.size(), 0), ssize_t(b.size()));
  }

 private:
  int listen_fd_;
  int fd_ = -1;
};

class Sensor1Test : public ::testing::Test {
 protected:
  void SetUp() override {
    log = std::make_unique<LogCapture>();
    sim = std::make_unique<Simulator>(test_socket_path());
    ASSERT_TRUE(sim->listening());
  }
  void TearDown() override {
    for (sensor1_handle_s* h : to_close) sensor1_close(h);
    sim.reset();
    EXPECT_EQ(sensor1_host_outstanding_bodies(), 0) << "a body was not released";
  }

  // Opens a connection of rec with tag; the handle is closed at TearDown.
  sensor1_handle_s* open(Sensor1Recorder& rec, int tag = 0) {
    sensor1_handle_s* h = nullptr;
    EXPECT_EQ(rec.open(tag, &h), 0);
    EXPECT_NE(h, nullptr);
    to_close.push_back(h);
    return h;
  }

  // Writes one request with a fresh body of the library; returns the write's result.
  int write(sensor1_handle_s* h, Header hdr, const Bytes& body, void** left = nullptr) {
    void* buf = nullptr;
    EXPECT_EQ(sensor1_alloc_msg_buf(h, static_cast<uint16_t>(body.size()), &buf), 0);
    if (buf == nullptr) return -1;
    memcpy(buf, body.data(), body.size());
    sensor1_msg_header_s m{hdr.service, hdr.msg_id, static_cast<uint16_t>(body.size()), hdr.txn_id};
    const int r = sensor1_write(h, &m, buf);
    if (left != nullptr) *left = buf;
    return r;
  }

  std::vector<std::string> lib_lines() const { return log->messages("libsensor1"); }

  std::unique_ptr<LogCapture> log;
  std::unique_ptr<Simulator> sim;
  std::vector<sensor1_handle_s*> to_close;
};

TEST_F(Sensor1Test, OpenIsRefusedUntilTheServiceAcceptsAndCloseEndsTheConnection) {
  EXPECT_EQ(sensor1_init(), 0);
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  sim->refuse_opens(11, 1);
  EXPECT_EQ(rec.open(0, &h), 11);
  sim->refuse_opens(5, 1);
  EXPECT_EQ(rec.open(0, &h), 5);
  sim->stop_listening();  // no socket file
  EXPECT_EQ(rec.open(0, &h), 11);
  const int fd = socket(AF_UNIX, SOCK_STREAM, 0);  // a socket file nobody listens on
  sockaddr_un addr = socket_address();
  ASSERT_EQ(bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
  EXPECT_EQ(rec.open(0, &h), 11);
  close(fd);
  EXPECT_EQ(h, nullptr);
  EXPECT_EQ(sim->opened_connections(), 0);

  sim->resume_listening();
  ASSERT_EQ(rec.open(0, &h), 0);
  EXPECT_EQ(sim->opened_connections(), 1);
  EXPECT_EQ(sensor1_close(h), 0);
  EXPECT_TRUE(sim->wait_for_disconnect(2s));
  EXPECT_EQ(sensor1_close(h), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(lib_lines(),
            (std::vector<std::string>{"open -> 11", "open -> 5", "open -> 11", "open -> 11",
                                      "open -> 0", "close -> 0", "close -> 22"}));
  EXPECT_TRUE(rec.deliveries().empty()) << "a close by the daemon is no broken pipe";
}

TEST_F(Sensor1Test, RecordsOnTheWireAreByteExact) {
  sim.reset();
  RawPeer peer;
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  Bytes open_record;
  std::thread service([&] {
    open_record = peer.accept_one();
    // OPEN_RESULT 0 and a RESPONSE in one segment: the response belongs to the callback.
    peer.send_bytes({0x05, 0, 0,    0,   64, 0, 0, 0, 0,                       // OPEN_RESULT 0
                     0x0F, 0, 0,    0,   65, 0, 0, 0, 0, 0x0B, 0, 0, 0, 2, 0,  // RESPONSE hdr
                     6,    0, 0x07, 0x00});                                    // txn 6, body
  });
  ASSERT_EQ(rec.open(0, &h), 0);
  service.join();
  to_close.push_back(h);
  EXPECT_EQ(open_record, (Bytes{0x01, 0, 0, 0, 0x01}));
  ASSERT_TRUE(rec.wait_for(1));
  EXPECT_EQ(summary(rec.deliveries()[0]), "1 [0 11 2 6] 0700");

  // A write: header fields little-endian, the signed msg_id included, then the body.
  EXPECT_EQ(write(h, {44, -2, 0, 169}, {0xAA, 0x01, 0xFF}), 0);
  EXPECT_EQ(peer.read(20), (Bytes{0x10, 0,    0,    0,    0x02, 0x2C, 0,    0,    0,    0xFE,
                                  0xFF, 0xFF, 0xFF, 0x03, 0x00, 0xA9, 0x00, 0xAA, 0x01, 0xFF}));
  // No body at all.
  sensor1_msg_header_s empty{0, 64, 0, 7};
  EXPECT_EQ(sensor1_write(h, &empty, nullptr), 0);
  EXPECT_EQ(peer.read(17),
            (Bytes{0x0D, 0, 0, 0, 0x02, 0, 0, 0, 0, 0x40, 0, 0, 0, 0, 0, 0x07, 0x00}));
  // A FAULT is acknowledged with its operation.
  peer.send_bytes({0x0A, 0, 0, 0, 68, 0x02, 0x05, 0, 0, 0, 0x01, 0, 0, 0});
  EXPECT_EQ(peer.read(6), (Bytes{0x02, 0, 0, 0, 0x03, 0x02}));
  void* left = nullptr;
  EXPECT_EQ(write(h, {0, 13, 0, 4}, {1}, &left), 5);
  sensor1_free_msg_buf(h, left);
}

TEST_F(Sensor1Test, EveryMessageKindReachesTheCallbackInOrder) {
  Sensor1Recorder rec;
  open(rec);
  sim->respond({0, 64, 0, 3}, {1, 2, 3});
  sim->indicate({44, 33, 0, 9}, {0x5a, 0xa5});
  sim->respond({0, 38, 0, 4}, {});  // an empty body still comes as a buffer
  sim->retry_open();
  sim->callback(7, true, true, {13, 5, 0, 2}, {9});
  sim->callback(1, false, true, {0, 2, 0, 2}, {8, 8});
  sim->callback(2, true, false, {0, 3, 0, 0}, {});
  sim->callback(250, false, false, {}, {});  // only a callback: the connection stays up
  ASSERT_TRUE(rec.wait_for(8));
  EXPECT_EQ(rec.summaries(), (std::vector<std::string>{
                                 "1 [0 64 3 3] 010203", "2 [44 33 2 9] 5aa5", "1 [0 38 0 4] ",
                                 "251 [0 0 0 0] no body", "7 [13 5 1 2] 09", "1 no header body",
                                 "2 [0 3 0 0] no body", "250 no header no body"}));
  EXPECT_EQ(log->count("connection ended, BROKEN_PIPE", "libsensor1"), 0u);
}

TEST_F(Sensor1Test, EndOfFileGivesOneBrokenPipeAndADeadHandle) {
  Sensor1Recorder rec;
  sensor1_handle_s* a = open(rec, 1);
  sim->drop_connection();
  ASSERT_TRUE(rec.wait_for(1));
  EXPECT_EQ(summary(rec.deliveries()[0]), "250 [0 0 0 0] no body");

  void* buf = reinterpret_cast<void*>(1);
  EXPECT_EQ(sensor1_alloc_msg_buf(a, 4, &buf), SENSOR1_HOST_EPIPE);
  EXPECT_EQ(buf, nullptr);
  void* body = sensor1_host_alloc_body(4);
  sensor1_msg_header_s hdr{0, 13, 4, 4};
  EXPECT_EQ(sensor1_write(a, &hdr, body), SENSOR1_HOST_EPIPE);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 1) << "a failed write leaves the body";
  sensor1_free_msg_buf(a, body);
  EXPECT_EQ(sensor1_close(a), 0);
  EXPECT_EQ(sensor1_close(a), SENSOR1_HOST_EINVAL);

  // Once the thread has served another connection, the ended one has had its only callback.
  open(rec, 2);
  sim->respond({0, 64, 0, 0}, {0});
  ASSERT_TRUE(rec.wait_for(2));
  EXPECT_EQ(rec.deliveries(1).size(), 1u);
  EXPECT_EQ(lib_lines(), (std::vector<std::string>{"open -> 0", "connection ended, BROKEN_PIPE",
                                                   "close -> 0", "close -> 22", "open -> 0"}));
}

TEST_F(Sensor1Test, FaultedWritesSendOrKeepTheBodyByResult) {
  Sensor1Recorder rec;
  sensor1_handle_s* h = open(rec);

  // 11: sent all the same, the body taken by the library.
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 11, 1));
  EXPECT_EQ(write(h, {0, 13, 0, 4}, {1, 1}), 11);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
  EXPECT_EQ(sim->next_request(2s).value_or(Request{}).body, (Bytes{1, 1}));

  // Another value: nothing sent, the body still the caller's.
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  void* left = nullptr;
  EXPECT_EQ(write(h, {0, 13, 0, 4}, {2, 2}, &left), 5);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 1);
  sensor1_free_msg_buf(h, left);
  EXPECT_EQ(write(h, {0, 13, 0, 4}, {3, 3}), 0);
  EXPECT_EQ(sim->next_request(2s).value_or(Request{}).body, (Bytes{3, 3}))
      << "the refused write was sent";

  // Count 0 clears a fault.
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 3));
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 0));
  EXPECT_EQ(write(h, {0, 13, 0, 4}, {4, 4}), 0);
  EXPECT_EQ(sim->next_request(2s).value_or(Request{}).body, (Bytes{4, 4}));
  EXPECT_EQ(log->messages("libsensor1"),
            (std::vector<std::string>{"open -> 0", "fault write -> 11 count 1",
                                      "fault write -> 5 count 1", "fault write -> 5 count 3",
                                      "fault write -> 5 count 0"}));
}

TEST_F(Sensor1Test, FaultedAllocGivesNoBufferAndFaultedCloseStillCloses) {
  Sensor1Recorder rec;
  sensor1_handle_s* h = open(rec, 1);
  to_close.clear();
  ASSERT_TRUE(sim->fault(FaultOp::kAlloc, 12, 2));
  void* buf = reinterpret_cast<void*>(1);
  EXPECT_EQ(sensor1_alloc_msg_buf(h, 12, &buf), 12);
  EXPECT_EQ(sensor1_alloc_msg_buf(h, 12, &buf), 12);
  EXPECT_EQ(buf, nullptr);
  EXPECT_EQ(sensor1_alloc_msg_buf(h, 12, &buf), 0);
  sensor1_free_msg_buf(h, buf);

  ASSERT_TRUE(sim->fault(FaultOp::kClose, 9, 1));
  EXPECT_EQ(sensor1_close(h), 9);
  EXPECT_TRUE(sim->wait_for_disconnect(2s));
  EXPECT_EQ(sensor1_alloc_msg_buf(h, 12, &buf), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(lib_lines(), (std::vector<std::string>{"open -> 0", "fault alloc -> 12 count 2",
                                                   "fault close -> 9 count 1", "close -> 9"}));
  // Once the thread has served another connection, the closed one is known to have had no
  // broken-pipe callback.
  open(rec, 2);
  sim->respond({0, 64, 0, 0}, {0});
  ASSERT_TRUE(rec.wait_for(1));
  EXPECT_TRUE(rec.deliveries(1).empty());
}

TEST_F(Sensor1Test, NullAndClosedHandlesAreRefusedWithoutHarm) {
  void* buf = reinterpret_cast<void*>(1);
  EXPECT_EQ(sensor1_alloc_msg_buf(nullptr, 4, &buf), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(buf, nullptr);
  void* body = sensor1_host_alloc_body(4);
  sensor1_msg_header_s hdr{0, 13, 4, 4};
  EXPECT_EQ(sensor1_write(nullptr, &hdr, body), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(sensor1_close(nullptr), SENSOR1_HOST_EINVAL);

  Sensor1Recorder rec;
  sensor1_handle_s* h = open(rec);
  to_close.clear();
  EXPECT_EQ(sensor1_write(h, nullptr, body), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(sensor1_write(h, &hdr, nullptr), SENSOR1_HOST_EINVAL) << "size 4 without a body";
  EXPECT_EQ(sensor1_close(h), 0);
  EXPECT_EQ(sensor1_alloc_msg_buf(h, 4, &buf), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(sensor1_write(h, &hdr, body), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(sensor1_close(h), SENSOR1_HOST_EINVAL);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 1);
  // Releasing works with any handle, a null one included.
  EXPECT_EQ(sensor1_free_msg_buf(nullptr, body), 0);
  EXPECT_EQ(sim->requests().size(), 0u);
}

TEST_F(Sensor1Test, CallbackMayBlockCloseItsConnectionAndOpenAnother) {
  Sensor1Recorder rec;
  sensor1_handle_s* a = open(rec, 1);
  to_close.clear();

  std::mutex mu;
  std::condition_variable cv;
  bool both_sent = false;
  bool done = false;
  int close_result = -1, open_result = -1;
  sensor1_handle_s* b = nullptr;
  rec.set_action([&](const Delivery& d) {
    if (d.tag != 1) return;
    std::unique_lock<std::mutex> lock(mu);
    cv.wait(lock, [&] { return both_sent; });  // both indications are queued on a by now
    close_result = sensor1_close(a);
    open_result = rec.open(2, &b);
    done = true;
    cv.notify_all();
  });
  sim->indicate({0, 13, 0, 4}, {1});
  sim->indicate({0, 13, 0, 4}, {2});
  {
    std::unique_lock<std::mutex> lock(mu);
    both_sent = true;
    cv.notify_all();
    ASSERT_TRUE(cv.wait_for(lock, 5s, [&] { return done; }));
  }
  EXPECT_EQ(close_result, 0);
  ASSERT_EQ(open_result, 0);
  to_close.push_back(b);
  EXPECT_EQ(sim->opened_connections(), 2);
  sim->respond({0, 64, 0, 0}, {7});  // to b, the current connection
  ASSERT_TRUE(rec.wait_for(1, 5s, 2));
  // The second indication, queued on a when the callback closed it, is never delivered.
  EXPECT_EQ(rec.summaries(1), std::vector<std::string>{"2 [0 13 1 4] 01"});
  EXPECT_EQ(rec.summaries(2), std::vector<std::string>{"1 [0 64 1 0] 07"});
  EXPECT_EQ(lib_lines(), (std::vector<std::string>{"open -> 0", "close -> 0", "open -> 0"}));
}

}  // namespace
