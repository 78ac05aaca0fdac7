// SPDX-License-Identifier: Apache-2.0
// The callback on the library's thread against the daemon's others: a broken link torn down and
// rebuilt (DIAG logging stopped and restarted as the debug level allows, a new coefficient
// refresh) while other threads open, write and close, results handed to a waiting main thread,
// register dumps kept whole under their lock. Whatever fails, every thread, held open and stand-in
// tool a test holds is let go and joined before the test ends.
#include <stdio.h>

#include <algorithm>
#include <future>
#include <thread>

#include "callback_fixture.h"
#include "diag/diag_logging.h"
#include "requests/request_pattern.h"
#include "requests/status_requests.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"

using namespace ::testing;
using namespace kestrel_sim;

namespace {

constexpr char kLastLine[] = "rcv_test_msg hh_read_data_thread success\n";
constexpr char kRefresh[] = "rcv_test_msg read/update light coef efs file in broken pipe\n";

// A register dump answer (result 3: relayed all the same, and 3 bytes to spare) whose register i
// holds index << 5 | (round ^ i) & 0x1f, so that every byte says which dump it belongs to.
Bytes dump_body(int index, int round) {
  Bytes body(143, 0);
  body[0] = 3;
  for (int i = 0; i < 128; ++i)
    body[12 + i] = static_cast<uint8_t>(index << 5 | ((round ^ i) & 0x1f));
  return body;
}

// A stand-in diag_mdlog that records its call, then waits (20 s at most) until the gate opens;
// it opens at the latest when the gate goes out of scope.
class ToolGate {
 public:
  explicit ToolGate(const FakeTools& tools) : go_(tools.dir() + "/go") {
    write_file(tools.dir() + "/diag_mdlog",
               "#!/bin/sh\necho \"diag_mdlog $*\" >> " + tools.dir() + "/calls\ni=0\nuntil [ -e " +
                   go_ + " ] || [ $i -ge 2000 ]; do sleep 0.01; " + "i=$((i+1)); done\n");
  }
  ~ToolGate() { open(); }
  void open() { write_file(go_, ""); }

 private:
  std::string go_;
};

// The main thread of a test: runs body on its own thread; at the end of the scope the held opens
// are let go and the thread is joined.
class MainThread {
 public:
  MainThread(Simulator& sim, std::function<void()> body)
      : sim_(sim), done_(std::async(std::launch::async, std::move(body))) {}
  ~MainThread() {
    sim_.release_held_opens();
    done_.wait();
  }
  // False when the body has not ended within timeout.
  bool ended(std::chrono::milliseconds timeout) {
    return done_.wait_for(timeout) == std::future_status::ready;
  }

 private:
  Simulator& sim_;
  std::future<void> done_;
};

class CallbackThreadsTest : public CallbackTest {
 protected:
  // The daemon's lines once the recovery and the new hh_read_data_thread (with its one frame) have
  // ended, without that thread's first line, which may come before or after the line that
  // reports its start.
  Lines recovery_lines() {
    EXPECT_TRUE(log->wait_for(kLastLine, 5000ms));
    EXPECT_THAT(frame(34, true), ElementsAre(4, 1, 0, 0));
    Lines out = lines();
    out.erase(std::remove(out.begin(), out.end(), "hh_read_data_thread start\n"), out.end());
    return out;
  }
};

// Reopened by the recovery itself, or taken from the main thread's open that was in progress
// (held longer than the recovery's three tries) when the recovery's first try came.
TEST_F(CallbackThreadsTest, DroppedLinkIsReopenedAndLoggingRestartedAsTheDebugLevelAllows) {
  sensor1_handle_s* handle = get_handle_for_sensor(0);
  const std::pair<bool, bool> cases[] = {{false, false}, {true, false}, {false, true}};
  for (const auto& [level_stops, main_opens] : cases) {
    write_file(test_properties_path(),
               level_stops ? "ro.debug_level=0x4f4c" : "ro.debug_level=0x494d");
    set_diag_logging_state(diag_state::logging);
    log->clear();
    sim->hold_opens(500ms, main_opens ? 1 : 0);
    sim->drop_connection();
    std::optional<MainThread> main;
    if (main_opens) {
      ASSERT_TRUE(log->wait_for("close -> 0", 5000ms, 1, "libsensor1"));
      main.emplace(*sim, [] { get_handle_for_sensor(0); });
    }

    char broken[64];
    snprintf(broken, sizeof broken, "BROKEN_PIPE sensor1_handle %p\n", static_cast<void*>(handle));
    Lines expected = {broken, "sensor1_open_or_reopen: sensor1_open success\n",
                      "get_handle_for_sensor: id:0\n", "BROKEN_PIPE success to open sensor1\n"};
    const Lines restart = {"check_property Success\n", "check_files is not exist -1\n",
                           "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
                           "sns_set_diag_tx_mode: diag_mdlog Enter 1\n"};
    const Lines diag = level_stops ? Lines{"check_loglevel stop logging\n"} : restart;
    expected.insert(expected.end(), diag.begin(), diag.end());
    expected.insert(expected.end(), {kRefresh, kLastLine});
    EXPECT_THAT(recovery_lines(), ElementsAreArray(expected));
    EXPECT_EQ(diag_logging_state(), level_stops ? diag_state::stopped : diag_state::logging);
    ASSERT_TRUE(tools.wait_for_calls(main_opens ? 5 : level_stops ? 3 : 2, 5000));
    handle = current_sensor1_handle();
  }
  EXPECT_EQ(sim->opened_connections(), 4);
  EXPECT_THAT(tools.calls(), ElementsAre(kStop, kStart, kStop, kStop, kStart));
}

TEST_F(CallbackThreadsTest, BrokenLinkWhileACommandWaitsThenResultsReachTheWaitingThread) {
  sensor1_handle_s* old = get_handle_for_sensor(0);
  // A command on another thread needs the service while the callback rebuilds it: whichever of
  // the two opens, the link is opened once.
  sensor1_handle_s* reopened = nullptr;
  std::thread command([&] {
    while ((reopened = get_handle_for_sensor(0)) == old || reopened == nullptr)
      std::this_thread::sleep_for(1ms);
  });
  set_test_status(-1);
  sim->drop_connection();
  EXPECT_EQ(wait_for_response(), 0) << "nothing came while the link was down";
  command.join();
  recovery_lines();
  EXPECT_EQ(log->count("BROKEN_PIPE success to open sensor1\n"), 1u);
  EXPECT_EQ(sim->opened_connections(), 2);
  EXPECT_EQ(current_sensor1_handle(), reopened);

  // Over the new link, each result reaches the waiting thread whole, after a sample and a dump
  // that keep the library's thread busy.
  for (int round = 1; round <= 20; ++round) {
    set_test_status(-1);
    sim->indicate(Header{0, 3, 0, 0}, sample_indication_body(0, 1, round << 16, 0, 0));
    sim->respond(Header{44, 32, 0, 169}, dump_body(0, round));
    sim->indicate(Header{0, 13, 0, 0},
                  test_indication_body(10, 1, 0, 0, 0, std::vector(12, round)));
    ASSERT_EQ(wait_for_response(), 1) << "round " << round;
    EXPECT_THAT(factory_state().gyro_result, Each(round));
    EXPECT_EQ(test_status(), 0);
  }
}

// A write fails on the main thread while the recovery, held in its DIAG stop, has not closed the
// link yet: the close is left to the recovery, so the main thread does not wait in sensor1_close
// for that callback.
TEST_F(CallbackThreadsTest, WriteFailureDuringARecoveryLeavesTheCloseToIt) {
  get_handle_for_sensor(0);
  ToolGate gate(tools);
  set_diag_logging_state(diag_state::logging);
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  sim->callback(250, true, false, Header{}, {});
  ASSERT_TRUE(tools.wait_for_calls(1, 5000));
  {
    MainThread main(*sim, [] { EXPECT_EQ(get_sensor_state(), -1); });
    EXPECT_TRUE(main.ended(2000ms)) << "the main thread waits for the recovery";
    gate.open();
  }
  recovery_lines();
  EXPECT_EQ(log->count("[get_sensor_state]sensor1_write -error  5\n"), 1u);
  EXPECT_EQ(log->count("BROKEN_PIPE success to open sensor1\n"), 1u);
  EXPECT_EQ(log->count("close waits for a callback", "libsensor1"), 0u);
  EXPECT_EQ(sim->opened_connections(), 2);
}

// The link breaks while the main thread opens it for a command (the broken pipe comes while the
// open's answer is held): the recovery waits for that open and closes the connection it made, on
// its own thread; its reopen is held in turn, and meanwhile the main thread goes on to command 36.
TEST_F(CallbackThreadsTest, LinkBrokenWhileTheMainThreadOpensIsClosedByItsRecoveryAlone) {
  sim->hold_opens(300ms, 1);  // longer than the recovery's three tries
  {
    MainThread main(*sim, [this] {
      command(0, {0});
      command(36);
    });
    ASSERT_TRUE(sim->wait_for_held_open(5000ms));
    sim->hold_opens(10000ms, 1);
    ASSERT_TRUE(sim->callback_to_held_open(250, true, false, Header{}, {}));
    ASSERT_TRUE(log->wait_for("close -> 0", 5000ms, 1, "libsensor1"));
    ASSERT_TRUE(sim->wait_for_held_open(5000ms));
    EXPECT_TRUE(log->wait_for("chown : end\n", 5000ms)) << "command 36 waits for the recovery";
  }
  recovery_lines();
  EXPECT_EQ(log->count("BROKEN_PIPE success to open sensor1\n"), 1u);
  EXPECT_EQ(log->count("close waits for a callback", "libsensor1"), 0u);
  EXPECT_EQ(sim->opened_connections(), 2);
  EXPECT_EQ(sim->current_connection(), 2);
}

// A request whose handle the recovery closed between its steps makes no call on that handle (the
// fixture counts them): the rest of it goes to the empty handle and fails there (22).
TEST_F(CallbackThreadsTest, RequestWhoseHandleWasClosedMeanwhileMakesNoCallOnIt) {
  const std::pair<std::function<void(sensor1_request*)>, Lines> cases[] = {
      {[](sensor1_request* r) { EXPECT_EQ(write_request(r), 22); }, {}},
      {[](sensor1_request* r) { EXPECT_FALSE(write_request_or_close(r)); },
       {"[probe]sensor1_write -error  22\n"}},
      {abandon_request, {}},
  };
  for (const auto& [finish, expected] : cases) {
    get_handle_for_sensor(0);
    sensor1_request req;
    ASSERT_TRUE(begin_request(&req, "probe", 0, 0, 64, 1, 0, alloc_failure_text::kPlain));
    close_sensor1_handle();
    log->clear();
    finish(&req);
    EXPECT_EQ(lines(), expected);
  }
}

TEST_F(CallbackThreadsTest, DumpsFromSeveralThreadsKeepFrameAndLinesTogether) {
  get_handle_for_sensor(0);
  log->clear();
  constexpr int kRounds = 30;
  auto dumps = [](int first) {
    for (int i = 0; i < kRounds; ++i)
      deliver(1, 44, 32, 169 + first + i % 3, dump_body(first + i % 3, i));
  };
  std::thread a(dumps, 0), b(dumps, 3);
  for (int i = 0; i < kRounds; ++i)
    sim->respond(Header{44, 32, 0, uint8_t(169 + i % 6)}, dump_body(i % 6, i));
  a.join();
  b.join();

  // Each frame holds one whole dump and padding to 148 bytes; its 130 lines follow as one block,
  // in the frames' order.
  Lines expected;
  for (int d = 0; d < 3 * kRounds; ++d) {
    const Bytes got = frame(20, true);
    ASSERT_EQ(got.size(), 132u);
    const Bytes body = dump_body(got[0], got[1] & 0x1f);
    EXPECT_TRUE(std::equal(got.begin() + 1, got.end(), body.begin() + 12)) << "frame " << d;
    const std::string dump = "+++++++++++ Print Register Dump for " + std::to_string(got[0]);
    expected.push_back(dump + " Start +++++++++++");
    for (unsigned r = 0; r < 128; ++r) {
      char line[64];
      snprintf(line, sizeof line, "+++++++++++ Reg_addr[0x%2x] : value[0x%2x] +++++++++++",
               (got[0] >= 4 ? 0x80 : 0) + r, unsigned{body[12 + r]});
      expected.push_back(line);
    }
    expected.push_back(dump + " End +++++++++++");
  }
  // A frame goes out before its lines: let the last dump end.
  ASSERT_TRUE(log->wait_for(expected.back(), 5000ms,
                            std::count(expected.begin(), expected.end(), expected.back())));
  const Lines got = lines();
  const auto [g, e] = std::mismatch(got.begin(), got.end(), expected.begin(), expected.end());
  EXPECT_TRUE(g == got.end() && e == expected.end()) << "line " << g - got.begin() << " differs";
  // Two digits, space-padded, for addresses and values; dumps 4 and 5 from address 0x80.
  EXPECT_THAT(got, Contains("+++++++++++ Reg_addr[0x 0] : value[0x 0] +++++++++++"));
  EXPECT_THAT(got, Contains("+++++++++++ Reg_addr[0x81] : value[0x80] +++++++++++"));
}

}  // namespace
