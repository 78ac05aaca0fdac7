// Every sensor1 request the daemon makes, end to end on the running daemon, through the fault
// knobs of the sensor1 stand-in: the allocation fails; the write returns 11 (EWOULDBLOCK, which
// counts as sent); the write fails with another error and the close that follows succeeds (the
// closing requests give up the connection, the next command opens a new one); and the write and
// the close both fail, which ends the process with the close's result as its exit status.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "tests/e2e/matrix_support.h"

namespace {

using namespace matrix;
using kestrel_sim::FaultOp;
using kestrel_sim::Request;

const char kClosed[] = "libsensor1: close -> 0";

struct Kind {
  const char* name;
  Bytes command;
  bool closing;            // a failed write closes the connection
  Lines alloc;             // main-thread lines from the walk's line on, every allocation failing
  bool reply_after_alloc;  // the reply still goes out, built from the stored results
  Lines write_error;       // the same when the write fails with 5
  bool reply_after_write;
  uint32_t requests = 1;    // requests the command writes when nothing fails
  int callback_frame = -1;  // frame type the callback sends for the answer, -1 for none
  // Where the write failure needs another command to reach the request alone, and the message
  // ids of the requests that command still writes after the failure, on the connection it opens.
  std::optional<Bytes> write_error_command = std::nullopt;
  std::vector<int32_t> requests_after_write_error = {};
};

std::string pm(int n) {
  return "process_message: " + std::to_string(n);
}
std::string alloc(const std::string& name) {
  return "[" + name + "]sensor1_alloc_msg_buf error - 12\n";
}
std::string write5(const std::string& name) {
  return "[" + name + "]sensor1_write -error  5\n";
}

std::vector<Kind> kinds() {
  const std::string get_raw12 = "get_raw error get_raw_data returned 12\n";
  Lines hidden_hole = {pm(35)};
  const char* names[] = {"sensor_type", "d_factor", "r_coef",    "g_coef",  "b_coef",
                         "c_coef",      "ct_coef",  "ct_offset", "th_high", "th_low"};
  for (int i = 0; i < 10; ++i) {
    hidden_hole.push_back(std::string("set_hidden_hole_data ") + names[i] + ":" +
                          std::to_string(i == 0 ? 4 : i) + "\n");
  }
  const std::string dump = "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (0)";
  const std::string mag =
      "get_mag_register_data: sensor_type = 8, pdata_sensor_type:2, id=20, "
      "send_to_kernel=1\n";
  const std::string store[] = {"store_calib_data: Enter\n", "store_calib_data: sensor_type = 0 \n"};
  const std::string selftest = "get_selftest_result: sensor_type = 0, id = 0\n";
  const std::string lpf = "set_accel_lpf: sensor_type = 12, id = 0\n";
  const std::string lpf_out = "send_accel_lpf_result OUT: test type = 11, lpf_on_off = 1\n";
  return {
      {"get_status",
       build_command(0, {0}),
       true,
       {pm(0), alloc("get_status")},
       false,
       {pm(0), write5("get_status"), kClosed},
       false},
      {"get_raw_data, sensor manager",
       build_command(1, {0}),
       false,
       {pm(1), alloc("get_raw_data")},
       false,
       {pm(1), write5("get_raw_data"), "get_raw_data: sensor_type = 0 txn_id = 2\n"},
       false},
      {"get_raw_data, light sensor",
       build_command(1, {4}),
       false,
       {pm(1), get_raw12},
       false,
       {pm(1), "get_raw_data sensor_type:4\n", "[DAF][get_raw_data]sensor1_write -error  5 4\n",
        "get_raw_data: sensor_type = 40 txn_id = 123\n"},
       false},
      {"stop_raw_data, sensor manager",
       build_command(3, {0}),
       false,
       {pm(3), alloc("stop_raw_data")},
       false,
       {pm(3), "[stop_raw_data]sensor1_write -error  5 0\n",
        "stop_raw_data: sensor_type = 0 txn_id = 2\n"},
       true},
      {"stop_raw_data, light sensor",
       build_command(3, {4}),
       false,
       {pm(3), get_raw12},
       false,
       {pm(3), "stop_raw_data sensor_type:4\n", "[DAF][stop_raw_data]sensor1_write -error  5 4\n",
        "stop_raw_data: sensor_type = 40 txn_id = 123\n"},
       true},
      {"store_calib_data",
       build_command(6, {0, 1}),
       true,
       {pm(6), store[0], store[1], alloc("store_calib_data")},
       false,
       {pm(6), store[0], store[1], "store_calib_data: CAL(1)",
        "store_calib_data: SensorID:0, DataType:0", write5("store_calib_data"), kClosed},
       false},
      {"get_selftest_result",
       build_command(8, {0}),
       true,
       {pm(8), selftest, alloc("get_selftest_result")},
       true,
       {pm(8), selftest, "get_selftest_result: LSM6DSM ACCEL SELFTEST, TestType = (6)\n",
        "get_selftest_result: msg_hdr.msg_id = 0xd, id = 0\n", write5("get_selftest_result"),
        kClosed},
       true},
      // The reset goes out while the report body of a magnetometer stream start is held. Its
      // failure closes the connection the body was taken on, so the report is taken anew on a
      // new connection and written there.
      {"reset_mag_cal (after the magnetometer self test; beside a magnetometer stream start)",
       build_command(8, {2}),
       true,
       {pm(8), "get_selftest_result: sensor_type = 2, id = 20\n", alloc("get_selftest_result"),
        "send_mag_selftest_result: id == SNS_SMGR_ID_MAG_V01", alloc("reset_mag_cal")},
       true,
       {pm(1), "get_raw_data: Reset Mag Cal IN", write5("reset_mag_cal"), kClosed,
        "get_raw_data: Reset Mag Cal OUT", "libsensor1: open -> 0",
        "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:2\n",
        "get_raw_data: sensor_type = 20 txn_id = 2\n"},
       false,
       2,
       -1,
       build_command(1, {2}),
       {2}},
      {"get_mag_register_data",
       build_command(11),
       true,
       {pm(11), mag, alloc("get_mag_register_data")},
       false,
       {pm(11), mag, "get_mag_register_data: MAG Read Fuserom\n",
        "get_mag_register_data: msg_hdr.msg_id = 0xd, id = 20\n", write5("get_mag_register_data"),
        kClosed},
       false},
      {"set_accel_lpf",
       build_command(15),
       true,
       {pm(15), lpf, alloc("set_accel_lpf"), lpf_out},
       true,
       {pm(15), lpf, "set_accel_lpf: K6DS3 ACCEL LPF ON\n",
        "set_accel_lpf: msg_hdr.msg_id = 0xd, id = 0\n", write5("set_accel_lpf"), kClosed, lpf_out},
       true},
      {"set_accel_motor",
       build_command(17),
       false,
       {pm(17), "set_accel_motor sensor1_alloc_msg_buf error:12\n"},
       false,
       {pm(17), "[DAF][set_accel_motor]sensor1_write -error  5 14\n",
        "set_accel_motor: Send Motor Enabled state done"},
       false},
      {"dump_register",
       build_command(19, {0}),
       false,
       {pm(19), dump, "dump_register sensor1_alloc_msg_buf error:12\n"},
       false,
       {pm(19), dump, "[DAF][dump_register]sensor1_write error 5\n"},
       false,
       1,
       20},
      // sensor_type 4, 4 data bytes 01 02 03 04.
      {"send_bigdata",
       build_frame(28, {4, 0, 0, 0, 4, 0, 0, 0, 1, 2, 3, 4}),
       false,
       {pm(28), "send_bigdata sensor1_alloc_msg_buf error:12\n"},
       false,
       {pm(28), "send_bigdata: type:28, id:40", "[DAF][send_bigdata]sensor1_write -error  5 4\n"},
       false,
       1,
       30},
      {"set_hidden_hole_data",
       build_command(35, {4, 1, 2, 3, 4, 5, 6, 7, 8, 9}),
       false,
       {pm(35), get_raw12},
       false,
       hidden_hole + Lines{"[DAF][set_hidden_hole_data]sensor1_write -error  5 4\n",
                           "set_hidden_hole_data: sensor_type = 40 txn_id = 123\n"},
       false},
      {"get_sensor_state",
       build_command(27, {0, 2}),
       true,
       {pm(27), alloc("get_sensor_state")},
       false,
       {pm(27), write5("get_sensor_state"), kClosed},
       false},
  };
}

// Whether the healthy phone's test indication came before or after the wait began is a race of
// the two threads; everything else of a healthy run is the same every time.
Lines without_race(Lines lines) {
  lines.erase(std::remove(lines.begin(), lines.end(),
                          std::string("wait_for_response: cb has arrived without waiting")),
              lines.end());
  return lines;
}

// The next n requests the simulator received, as (connection, service, msg id, size, txn, body).
using Sent = std::tuple<int, int, int, int, int, Bytes>;
std::vector<Sent> take_requests(kestrel_sim::Simulator& sim, size_t n) {
  std::vector<Sent> out;
  while (out.size() < n) {
    auto r = sim.next_request(5s);
    EXPECT_TRUE(r) << "request " << out.size() + 1 << " of " << n;
    if (!r) break;
    out.emplace_back(r->connection, r->header.service, r->header.msg_id, r->header.msg_size,
                     r->header.txn_id, r->body);
  }
  return out;
}

TEST(RequestFaultMatrix, EveryRequestSurvivesAllocationAndWriteFailures) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  int connection = 1;
  // After a closing request closed the connection, the next command opens a new one on the main
  // thread before it writes, and its request goes out there; the last one checks that no request
  // went out that the cases did not expect.
  auto expect_next_request_on = [&](const Lines& lines) {
    EXPECT_EQ(rig.run(build_command(27, {0, 2})).lines, lines);
    const auto next = take_requests(rig.sim, 1);
    ASSERT_EQ(next.size(), 1u);
    EXPECT_EQ(std::get<0>(next[0]), connection);
    EXPECT_EQ(std::get<2>(next[0]), 64);
  };
  for (const Kind& kind : kinds()) {
    SCOPED_TRACE(kind.name);
    // Nothing fails: the reference run.
    const Outcome healthy = rig.run(kind.command);
    const auto sent = take_requests(rig.sim, kind.requests);
    ASSERT_EQ(sent.size(), kind.requests) << rig.daemon->output();
    std::optional<Frame> answer;
    if (kind.callback_frame >= 0) {
      answer = rig.callback_frame(static_cast<uint16_t>(kind.callback_frame), 5s);
      ASSERT_TRUE(answer);
    }

    // The allocation fails: the failure line, nothing written, and the reply only where it is
    // built from the stored results.
    ASSERT_TRUE(rig.sim.fault(FaultOp::kAlloc, 12, kind.requests));
    const Outcome failed_alloc = rig.run(kind.command);
    EXPECT_EQ(failed_alloc.lines, kind.alloc);
    EXPECT_EQ(raw_frames(failed_alloc),
              kind.reply_after_alloc ? raw_frames(healthy) : std::vector<Bytes>());
    EXPECT_FALSE(healthy.frames.empty() && kind.reply_after_alloc);

    // The write returns 11: the request goes out and everything happens as without a fault.
    ASSERT_TRUE(rig.sim.fault(FaultOp::kWrite, 11, kind.requests));
    const Outcome would_block = rig.run(kind.command);
    EXPECT_EQ(without_race(would_block.lines), without_race(healthy.lines));
    EXPECT_EQ(raw_frames(would_block), raw_frames(healthy));
    EXPECT_EQ(take_requests(rig.sim, kind.requests), sent);
    if (answer) {
      auto again = rig.callback_frame(answer->type, 5s);
      ASSERT_TRUE(again);
      EXPECT_EQ(again->raw, answer->raw);
    }

    // The write fails and the close succeeds.
    ASSERT_TRUE(rig.sim.fault(FaultOp::kWrite, 5, 1));
    const Outcome failed = rig.run(kind.write_error_command.value_or(kind.command));
    EXPECT_EQ(failed.lines, kind.write_error);
    EXPECT_EQ(raw_frames(failed),
              kind.reply_after_write ? raw_frames(healthy) : std::vector<Bytes>());
    EXPECT_FALSE(healthy.frames.empty() && kind.reply_after_write);
    if (!kind.requests_after_write_error.empty()) {
      ++connection;
      const auto after = take_requests(rig.sim, kind.requests_after_write_error.size());
      for (size_t i = 0; i < after.size(); ++i) {
        EXPECT_EQ(std::get<0>(after[i]), connection);
        EXPECT_EQ(std::get<2>(after[i]), kind.requests_after_write_error[i]);
      }
    } else if (kind.closing) {
      ++connection;
      ASSERT_TRUE(rig.sim.wait_for_disconnect(5s)) << "the failed write closed the connection";
      expect_next_request_on({pm(27), "libsensor1: open -> 0",
                              "sensor1_open_or_reopen: sensor1_open success\n",
                              "get_handle_for_sensor: id:0\n"});
    } else {
      EXPECT_EQ(rig.sim.current_connection(), connection);
    }
  }
  expect_next_request_on({pm(27)});
  EXPECT_FALSE(rig.daemon->wait_exit(0ms)) << "the daemon still runs";
}

TEST(RequestFaultMatrix, AFailedWriteWhoseCloseFailsEndsTheDaemonWithTheCloseResult) {
  int status = 40;
  for (const Kind& kind : kinds()) {
    if (!kind.closing) continue;
    SCOPED_TRACE(kind.name);
    ++status;
    Rig rig;
    rig.start();
    rig.wait_until_settled();
    ASSERT_TRUE(rig.sim.fault(FaultOp::kWrite, 5, 1));
    ASSERT_TRUE(rig.sim.fault(FaultOp::kClose, status, 1));
    ASSERT_TRUE(rig.kernel.send(kind.write_error_command.value_or(kind.command)));
    EXPECT_EQ(rig.daemon->wait_exit(10s), status);
    const std::string last = "sensor1_close returned " + std::to_string(status) + "\n";
    ASSERT_TRUE(rig.daemon->wait_for(last, 5s)) << rig.daemon->output();
    // The lines up to the write failure are those of the closing run above; then the close
    // with its result, and the process ends.
    const auto close = std::find(kind.write_error.begin(), kind.write_error.end(), kClosed);
    const Lines expected = Lines(kind.write_error.begin(), close) +
                           Lines{"libsensor1: close -> " + std::to_string(status), last};
    const Lines main = rig.main_lines();
    auto walk = std::find(main.begin(), main.end(), expected.front());
    ASSERT_NE(walk, main.end());
    EXPECT_EQ(Lines(walk, main.end()), expected);
    for (const Frame& f : rig.kernel.drain(0ms)) {
      EXPECT_FALSE(is_reply_frame(f.type)) << "no reply after the failure, got type " << f.type;
    }
  }
}

}  // namespace
