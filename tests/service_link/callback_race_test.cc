// The callback on the library's thread against the daemon's others: a broken link torn down and
// rebuilt (DIAG logging stopped and restarted as the debug level allows, a new coefficient
// refresh), results handed to a waiting main thread, register dumps kept whole under their lock.
#include <signal.h>
#include <stdio.h>
#include <unistd.h>

#include <algorithm>
#include <thread>

#include "callback_fixture.h"
#include "diag/diag_logging.h"
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

TEST_F(CallbackThreadsTest, DroppedLinkIsReopenedAndLoggingRestartedAsTheDebugLevelAllows) {
  sensor1_handle_s* handle = get_handle_for_sensor(0);
  for (const bool level_stops : {false, true}) {
    write_file(test_properties_path(),
               level_stops ? "ro.debug_level=0x4f4c" : "ro.debug_level=0x494d");
    set_diag_logging_state(diag_state::logging);
    log->clear();
    sim->drop_connection();

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
    ASSERT_TRUE(tools.wait_for_calls(level_stops ? 3 : 2, 5000));
    handle = current_sensor1_handle();
  }
  EXPECT_EQ(sim->opened_connections(), 3);
  EXPECT_THAT(tools.calls(), ElementsAre(kStop, kStart, kStop));
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

// A write fails on the main thread while the callback, on the library's thread, is rebuilding the
// link (held in its DIAG stop until the main thread is inside sensor1_close, which waits for that
// callback to return): both go on, and the link is rebuilt. A deadlock ends the process.
TEST_F(CallbackThreadsTest, WriteFailureWhileTheLinkIsRebuiltDoesNotDeadlock) {
  signal(SIGALRM, [](int) {
    if (write(2, "deadlock: close and recovery wait for each other\n", 49) > 0) _exit(3);
  });
  alarm(10);
  get_handle_for_sensor(0);
  write_file(tools.dir() + "/diag_mdlog", "#!/bin/sh\necho \"diag_mdlog $*\" >> " + tools.dir() +
                                              "/calls\nwhile [ ! -e " + tools.dir() +
                                              "/go ]; do sleep 0.01; done\n");
  set_diag_logging_state(diag_state::logging);
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  sim->callback(250, true, false, Header{}, {});
  ASSERT_TRUE(tools.wait_for_calls(1, 5000));
  std::thread main_thread(get_sensor_state);
  ASSERT_TRUE(log->wait_for("[get_sensor_state]sensor1_write -error  5\n", 5000ms));
  std::this_thread::sleep_for(200ms);  // into sensor1_close
  write_file(tools.dir() + "/go", "");
  main_thread.join();
  recovery_lines();
  alarm(0);
  EXPECT_EQ(log->count("BROKEN_PIPE success to open sensor1\n"), 1u);
  EXPECT_EQ(sim->opened_connections(), 2);
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
