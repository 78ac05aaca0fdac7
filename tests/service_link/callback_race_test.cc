// The callback on the library's thread against the daemon's others: a broken link torn down and
// rebuilt (DIAG logging stopped and restarted as the debug level allows, a new coefficient
// refresh), results handed to a waiting main thread, register dumps kept whole under their lock.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

#include "daemon_fixture.h"
#include "diag/diag_logging.h"
#include "sensor1_host.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"
#include "service_link/service_callback.h"

using kestrel_sim::Header;
using kestrel_sim::sample_indication_body;
using kestrel_sim::test_indication_body;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::IsEmpty;

namespace {

using Bytes = std::vector<uint8_t>;

constexpr char kStopCall[] = "diag_mdlog -k -p 16";
constexpr char kStartCall[] =
    "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c";
constexpr char kOpened[] = "sensor1_open_or_reopen: sensor1_open success\n";
constexpr char kId0[] = "get_handle_for_sensor: id:0\n";
constexpr char kReopened[] = "BROKEN_PIPE success to open sensor1\n";
constexpr char kRefresh[] = "rcv_test_msg read/update light coef efs file in broken pipe\n";
constexpr char kLastLine[] = "rcv_test_msg hh_read_data_thread success\n";

std::string handle_line(const sensor1_handle_s* handle) {
  char line[64];
  snprintf(line, sizeof line, "BROKEN_PIPE sensor1_handle %p\n", static_cast<const void*>(handle));
  return line;
}

// A register dump answer whose 128 bytes all say which dump and which round they belong to.
Bytes dump_body(uint8_t index, uint8_t round) {
  Bytes body(140, 0);
  memset(body.data() + 12, (index << 5) | (round & 0x1f), 128);
  return body;
}

// One dump handed to the callback directly, from whichever thread calls this.
void deliver_dump(uint8_t index, uint8_t round) {
  const Bytes body = dump_body(index, round);
  sensor1_msg_header_s hdr = {44, 32, 140, static_cast<uint8_t>(169 + index)};
  void* msg = sensor1_host_alloc_body(body.size());
  memcpy(msg, body.data(), body.size());
  rcv_test_msg(sensor1_callback_data(), &hdr, 1, msg);
}

class CallbackThreadsTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    saved_path_ = getenv("PATH");
    setenv("PATH", (tools_.dir() + ":" + saved_path_).c_str(), 1);
  }
  void TearDown() override {
    setenv("PATH", saved_path_.c_str(), 1);
    remove_file(test_properties_path());
    DaemonFixture::TearDown();
  }
  sensor1_handle_s* open_link() {
    sensor1_handle_s* handle = get_handle_for_sensor(0);
    EXPECT_NE(handle, nullptr);
    EXPECT_TRUE(sim->wait_for_connection(2000ms));
    return handle;
  }
  // The daemon's lines without the new thread's first one, which may come before or after the
  // line that reports its start.
  std::vector<std::string> recovery_lines() const {
    std::vector<std::string> out = lines();
    out.erase(std::remove(out.begin(), out.end(), "hh_read_data_thread start\n"), out.end());
    return out;
  }
  size_t records_of(const std::string& tag) const {
    const std::vector<LogRecord> all = log->records();
    return std::count_if(all.begin(), all.end(), [&](const LogRecord& r) { return r.tag == tag; });
  }
  // The one frame of the new hh_read_data_thread.
  void expect_refresh_frame() {
    auto f = kernel->receive_type(34, 5000ms);
    ASSERT_TRUE(f) << "no frame from the new hh_read_data_thread";
    EXPECT_THAT(f->raw,
                ElementsAre(20, 0, 0, 0, 34, 0, 0, 0, 0, 0, 0, 0, 0x20, 0x4e, 0, 0, 4, 1, 0, 0));
  }

  FakeTools tools_;
  std::string saved_path_;
};

TEST_F(CallbackThreadsTest, DroppedLinkIsReopenedAndLoggingRestarted) {
  sensor1_handle_s* old = open_link();
  set_diag_logging_state(1);
  log->clear();

  sim->drop_connection();
  ASSERT_TRUE(log->wait_for(kLastLine, 5000ms));
  EXPECT_THAT(recovery_lines(),
              ElementsAre(handle_line(old), kOpened, kId0, kReopened, "check_property Success\n",
                          "check_files is not exist -1\n",
                          "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
                          "sns_set_diag_tx_mode: diag_mdlog Enter 1\n", kRefresh, kLastLine));
  EXPECT_EQ(sim->opened_connections(), 2);
  EXPECT_NE(current_sensor1_handle(), nullptr);
  EXPECT_NE(current_sensor1_handle(), old);
  EXPECT_EQ(diag_logging_state(), 1);
  ASSERT_TRUE(tools_.wait_for_calls(2, 5000));
  EXPECT_THAT(tools_.calls(), ElementsAre(kStopCall, kStartCall));
  expect_refresh_frame();
}

TEST_F(CallbackThreadsTest, DebugLevelKeepsLoggingStopped) {
  write_file(test_properties_path(), "ro.debug_level=0x4f4c\n");
  sensor1_handle_s* old = open_link();
  set_diag_logging_state(1);
  log->clear();

  sim->drop_connection();
  ASSERT_TRUE(log->wait_for(kLastLine, 5000ms));
  EXPECT_THAT(recovery_lines(), ElementsAre(handle_line(old), kOpened, kId0, kReopened,
                                            "check_loglevel stop logging\n", kRefresh, kLastLine));
  EXPECT_EQ(diag_logging_state(), 0);
  EXPECT_EQ(records_of("libdiag"), 0u) << "the logging setup is not touched";
  EXPECT_THAT(tools_.calls(), ElementsAre(kStopCall));
  expect_refresh_frame();
}

TEST_F(CallbackThreadsTest, SpentBudgetMakesNoAttempt) {
  sim->stop_listening();
  ASSERT_EQ(get_handle_for_sensor(0), nullptr);
  ASSERT_EQ(open_retry_budget(), 0);
  sim->resume_listening();  // the service is back, but the budget allows no attempt
  log->clear();

  // No connection is left to report it on: the event is handed over directly.
  sensor1_msg_header_s hdr = {};
  rcv_test_msg(sensor1_callback_data(), &hdr, 250, nullptr);
  EXPECT_THAT(
      recovery_lines(),
      ElementsAre(handle_line(nullptr), "BROKEN_PIPE fail to open sensor1\n", kRefresh, kLastLine));
  EXPECT_EQ(records_of("libsensor1"), 0u) << "no open attempt";
  EXPECT_EQ(sim->opened_connections(), 0);
  EXPECT_THAT(tools_.calls(), IsEmpty()) << "logging was not running";
  expect_refresh_frame();
}

TEST_F(CallbackThreadsTest, BrokenLinkWhileACommandWaitsAndOpens) {
  sensor1_handle_s* old = open_link();
  // A command on another thread needs the service while the callback rebuilds it: whichever of
  // the two opens, the link is opened once.
  sensor1_handle_s* reopened = nullptr;
  std::thread command([&] {
    while ((reopened = get_handle_for_sensor(0)) == old || reopened == nullptr) {
      std::this_thread::sleep_for(1ms);
    }
  });
  set_test_status(-1);
  sim->drop_connection();
  EXPECT_EQ(wait_for_response(), 0) << "nothing came while the link was down";
  command.join();
  ASSERT_TRUE(log->wait_for(kLastLine, 5000ms));
  EXPECT_EQ(log->count(kReopened), 1u);
  EXPECT_EQ(sim->opened_connections(), 2);
  EXPECT_EQ(current_sensor1_handle(), reopened);

  ASSERT_TRUE(sim->wait_for_connection(2000ms));
  sim->indicate(Header{0, 13, 0, 0}, test_indication_body(0, 6, 0, 0, 0, std::vector(8, 7)));
  EXPECT_EQ(wait_for_response(), 1);
  EXPECT_THAT(factory_state().accel_result, Each(7));
  expect_refresh_frame();
}

TEST_F(CallbackThreadsTest, ResultsReachTheWaitingThreadWhole) {
  open_link();
  constexpr int kRounds = 20;
  for (int round = 1; round <= kRounds; ++round) {
    set_test_status(-1);
    sim->indicate(Header{0, 3, 0, 0}, sample_indication_body(0, 1, round << 16, 0, 0));
    sim->respond(Header{44, 32, 0, 169}, dump_body(0, static_cast<uint8_t>(round)));
    sim->indicate(Header{0, 13, 0, 0},
                  test_indication_body(10, 1, 0, 0, 0, std::vector<int32_t>(12, round)));
    ASSERT_EQ(wait_for_response(), 1) << "round " << round;
    const factory_results r = factory_state();
    EXPECT_THAT(r.gyro_result, Each(round));
    EXPECT_EQ(r.test_status, 0);
  }
  for (int round = 1; round <= kRounds; ++round) {
    auto f = kernel->receive_type(2, 5000ms);
    ASSERT_TRUE(f);
    EXPECT_EQ(f->payload[4], round) << "samples keep their order";
    ASSERT_TRUE(kernel->receive_type(20, 5000ms));
  }
}

TEST_F(CallbackThreadsTest, DumpsFromSeveralThreadsKeepFrameAndLinesTogether) {
  open_link();
  constexpr int kRounds = 30;
  std::thread a([] {
    for (int i = 0; i < kRounds; ++i) deliver_dump(i % 3, i);
  });
  std::thread b([] {
    for (int i = 0; i < kRounds; ++i) deliver_dump(3 + i % 3, i);
  });
  for (int i = 0; i < kRounds; ++i) {
    sim->respond(Header{44, 32, 0, static_cast<uint8_t>(169 + i % 6)}, dump_body(i % 6, i));
  }
  a.join();
  b.join();

  std::vector<uint8_t> frame_order;
  for (int i = 0; i < 3 * kRounds; ++i) {
    auto f = kernel->receive_type(20, 5000ms);
    ASSERT_TRUE(f) << "frame " << i;
    const uint8_t index = f->payload[0];
    EXPECT_EQ(f->payload[1] >> 5, index) << "the bytes of another dump";
    EXPECT_THAT(Bytes(f->payload.begin() + 1, f->payload.begin() + 129), Each(f->payload[1]));
    frame_order.push_back(index);
  }
  // A frame goes out before its lines: let the last dumps finish. Every index comes kRounds / 2
  // times, a third of one thread's rounds and a sixth of the library's.
  for (int index = 0; index < 6; ++index) {
    ASSERT_TRUE(log->wait_for(
        "+++++++++++ Print Register Dump for " + std::to_string(index) + " End +++++++++++", 5000ms,
        kRounds / 2));
  }

  // Each dump's lines form one block of 130, and the blocks come in the order of the frames.
  std::vector<std::string> dump_lines;
  for (const std::string& m : lines()) {
    if (m.rfind("+++++++++++ ", 0) == 0) dump_lines.push_back(m);
  }
  ASSERT_EQ(dump_lines.size(), frame_order.size() * 130);
  for (size_t d = 0; d < frame_order.size(); ++d) {
    const std::string index = std::to_string(frame_order[d]);
    const std::string* block = &dump_lines[d * 130];
    EXPECT_EQ(block[0], "+++++++++++ Print Register Dump for " + index + " Start +++++++++++");
    for (int i = 1; i <= 128; ++i) EXPECT_EQ(block[i].rfind("+++++++++++ Reg_addr[", 0), 0u);
    EXPECT_EQ(block[129], "+++++++++++ Print Register Dump for " + index + " End +++++++++++");
  }
}

}  // namespace
