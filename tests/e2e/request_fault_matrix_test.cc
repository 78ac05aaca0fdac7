// Every sensor1 request the daemon makes, end to end on the running daemon, through the fault
// knobs of the sensor1 stand-in: the allocation fails; the write returns 11 (EWOULDBLOCK, which
// counts as sent); the write fails with another error and the close that follows succeeds (the
// closing requests give up the connection, the next command opens a new one); and the write and
// the close both fail, which ends the process with the close's result as its exit status.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <optional>
#include <string>
#include <vector>

#include "tests/e2e/matrix_support.h"

namespace {

using namespace matrix;
using kestrel_sim::FaultOp;
using kestrel_sim::Request;

constexpr int32_t kAllocError = 12;
constexpr int32_t kWriteError = 5;

struct Kind {
  const char* name;
  std::vector<uint8_t> command;
  bool closing;            // a failed write closes the connection
  uint32_t requests;       // requests the command writes when nothing fails
  int callback_frame;      // frame type the callback sends for the answer, -1 for none
  Lines alloc;             // main-thread lines from the walk's line on, every allocation failing
  bool reply_after_alloc;  // the reply still goes out, built from the stored results
  Lines write_error;       // the same when the write fails with kWriteError
  bool reply_after_write;
  // Where the write failure needs another command to reach the request alone.
  std::optional<std::vector<uint8_t>> write_error_command = std::nullopt;
  // The message ids of the requests that command still writes after the failure, on the
  // connection it opens itself.
  std::vector<int32_t> requests_after_write_error = {};
};

std::vector<uint8_t> bigdata_28() {
  // sensor_type 4, 4 data bytes 01 02 03 04.
  return command_frame_bytes(28, {4, 0, 0, 0, 4, 0, 0, 0, 1, 2, 3, 4});
}

std::vector<Kind> kinds() {
  const std::string write5 = std::to_string(kWriteError);
  const Lines closed = {"libsensor1: close -> 0"};
  auto plus = [](Lines a, const Lines& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
  };
  Lines hidden_hole = {"process_message: 35"};
  const char* names[] = {"sensor_type", "d_factor", "r_coef",    "g_coef",  "b_coef",
                         "c_coef",      "ct_coef",  "ct_offset", "th_high", "th_low"};
  for (int i = 0; i < 10; ++i) {
    hidden_hole.push_back(std::string("set_hidden_hole_data ") + names[i] + ":" +
                          std::to_string(i == 0 ? 4 : i) + "\n");
  }
  return {
      {"get_status",
       command_frame(0, {0}),
       true,
       1,
       -1,
       {"process_message: 0", "[get_status]sensor1_alloc_msg_buf error - 12\n"},
       false,
       plus({"process_message: 0", "[get_status]sensor1_write -error  5\n"}, closed),
       false},
      {"get_raw_data, sensor manager",
       command_frame(1, {0}),
       false,
       1,
       -1,
       {"process_message: 1", "[get_raw_data]sensor1_alloc_msg_buf error - 12\n"},
       false,
       {"process_message: 1", "[get_raw_data]sensor1_write -error  5\n",
        "get_raw_data: sensor_type = 0 txn_id = 2\n"},
       false},
      {"get_raw_data, light sensor",
       command_frame(1, {4}),
       false,
       1,
       -1,
       {"process_message: 1", "get_raw error get_raw_data returned 12\n"},
       false,
       {"process_message: 1", "get_raw_data sensor_type:4\n",
        "[DAF][get_raw_data]sensor1_write -error  5 4\n",
        "get_raw_data: sensor_type = 40 txn_id = 123\n"},
       false},
      {"stop_raw_data, sensor manager",
       command_frame(3, {0}),
       false,
       1,
       -1,
       {"process_message: 3", "[stop_raw_data]sensor1_alloc_msg_buf error - 12\n"},
       false,
       {"process_message: 3", "[stop_raw_data]sensor1_write -error  5 0\n",
        "stop_raw_data: sensor_type = 0 txn_id = 2\n"},
       true},
      {"stop_raw_data, light sensor",
       command_frame(3, {4}),
       false,
       1,
       -1,
       {"process_message: 3", "get_raw error get_raw_data returned 12\n"},
       false,
       {"process_message: 3", "stop_raw_data sensor_type:4\n",
        "[DAF][stop_raw_data]sensor1_write -error  5 4\n",
        "stop_raw_data: sensor_type = 40 txn_id = 123\n"},
       true},
      {"store_calib_data",
       command_frame(6, {0, 1}),
       true,
       1,
       -1,
       {"process_message: 6", "store_calib_data: Enter\n", "store_calib_data: sensor_type = 0 \n",
        "[store_calib_data]sensor1_alloc_msg_buf error - 12\n"},
       false,
       plus({"process_message: 6", "store_calib_data: Enter\n",
             "store_calib_data: sensor_type = 0 \n", "store_calib_data: CAL(1)",
             "store_calib_data: SensorID:0, DataType:0",
             "[store_calib_data]sensor1_write -error  5\n"},
            closed),
       false},
      {"get_selftest_result",
       command_frame(8, {0}),
       true,
       1,
       -1,
       {"process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
        "[get_selftest_result]sensor1_alloc_msg_buf error - 12\n"},
       true,
       plus({"process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
             "get_selftest_result: LSM6DSM ACCEL SELFTEST, TestType = (6)\n",
             "get_selftest_result: msg_hdr.msg_id = 0xd, id = 0\n",
             "[get_selftest_result]sensor1_write -error  5\n"},
            closed),
       true},
      {"reset_mag_cal (after the magnetometer self test; beside a magnetometer stream start)",
       command_frame(8, {2}),
       true,
       2,
       -1,
       {"process_message: 8", "get_selftest_result: sensor_type = 2, id = 20\n",
        "[get_selftest_result]sensor1_alloc_msg_buf error - 12\n",
        "send_mag_selftest_result: id == SNS_SMGR_ID_MAG_V01",
        "[reset_mag_cal]sensor1_alloc_msg_buf error - 12\n"},
       true,
       // The reset goes out while the report body is held. Its failure closes the connection
       // the body was taken on, so the report is taken anew on a new connection and written there.
       plus(plus({"process_message: 1", "get_raw_data: Reset Mag Cal IN",
                  "[reset_mag_cal]sensor1_write -error  5\n"},
                 closed),
            {"get_raw_data: Reset Mag Cal OUT", "libsensor1: open -> 0",
             "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:2\n",
             "get_raw_data: sensor_type = 20 txn_id = 2\n"}),
       false,
       command_frame(1, {2}),
       {2}},
      {"get_mag_register_data",
       command_frame(11),
       true,
       1,
       -1,
       {"process_message: 11",
        "get_mag_register_data: sensor_type = 8, pdata_sensor_type:2, id=20, send_to_kernel=1\n",
        "[get_mag_register_data]sensor1_alloc_msg_buf error - 12\n"},
       false,
       plus({"process_message: 11",
             "get_mag_register_data: sensor_type = 8, pdata_sensor_type:2, id=20, "
             "send_to_kernel=1\n",
             "get_mag_register_data: MAG Read Fuserom\n",
             "get_mag_register_data: msg_hdr.msg_id = 0xd, id = 20\n",
             "[get_mag_register_data]sensor1_write -error  5\n"},
            closed),
       false},
      {"set_accel_lpf",
       command_frame(15),
       true,
       1,
       -1,
       {"process_message: 15", "set_accel_lpf: sensor_type = 12, id = 0\n",
        "[set_accel_lpf]sensor1_alloc_msg_buf error - 12\n",
        "send_accel_lpf_result OUT: test type = 11, lpf_on_off = 1\n"},
       true,
       plus(plus({"process_message: 15", "set_accel_lpf: sensor_type = 12, id = 0\n",
                  "set_accel_lpf: K6DS3 ACCEL LPF ON\n",
                  "set_accel_lpf: msg_hdr.msg_id = 0xd, id = 0\n",
                  "[set_accel_lpf]sensor1_write -error  5\n"},
                 closed),
            {"send_accel_lpf_result OUT: test type = 11, lpf_on_off = 1\n"}),
       true},
      {"set_accel_motor",
       command_frame(17),
       false,
       1,
       -1,
       {"process_message: 17", "set_accel_motor sensor1_alloc_msg_buf error:12\n"},
       false,
       {"process_message: 17", "[DAF][set_accel_motor]sensor1_write -error  5 14\n",
        "set_accel_motor: Send Motor Enabled state done"},
       false},
      {"dump_register",
       command_frame(19, {0}),
       false,
       1,
       20,
       {"process_message: 19", "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (0)",
        "dump_register sensor1_alloc_msg_buf error:12\n"},
       false,
       {"process_message: 19", "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (0)",
        "[DAF][dump_register]sensor1_write error 5\n"},
       false},
      {"send_bigdata",
       bigdata_28(),
       false,
       1,
       30,
       {"process_message: 28", "send_bigdata sensor1_alloc_msg_buf error:12\n"},
       false,
       {"process_message: 28", "send_bigdata: type:28, id:40",
        "[DAF][send_bigdata]sensor1_write -error  5 4\n"},
       false},
      {"set_hidden_hole_data",
       command_frame(35, {4, 1, 2, 3, 4, 5, 6, 7, 8, 9}),
       false,
       1,
       -1,
       {"process_message: 35", "get_raw error get_raw_data returned 12\n"},
       false,
       plus(hidden_hole, {"[DAF][set_hidden_hole_data]sensor1_write -error  5 4\n",
                          "set_hidden_hole_data: sensor_type = 40 txn_id = 123\n"}),
       false},
      {"get_sensor_state",
       command_frame(27, {0, 2}),
       true,
       1,
       -1,
       {"process_message: 27", "[get_sensor_state]sensor1_alloc_msg_buf error - 12\n"},
       false,
       plus({"process_message: 27", "[get_sensor_state]sensor1_write -error  5\n"}, closed),
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

std::vector<std::vector<uint8_t>> raw_frames(const Outcome& o) {
  std::vector<std::vector<uint8_t>> out;
  for (const KernelFrame& f : o.frames) out.push_back(f.raw);
  return out;
}

std::vector<Request> take_requests(kestrel_sim::Simulator& sim, uint32_t n) {
  std::vector<Request> out;
  for (uint32_t i = 0; i < n; ++i) {
    auto r = sim.next_request(5s);
    EXPECT_TRUE(r) << "request " << i + 1 << " of " << n;
    if (!r) break;
    out.push_back(std::move(*r));
  }
  return out;
}

void expect_same_requests(const std::vector<Request>& got, const std::vector<Request>& want) {
  ASSERT_EQ(got.size(), want.size());
  for (size_t i = 0; i < got.size(); ++i) {
    EXPECT_EQ(got[i].connection, want[i].connection);
    EXPECT_EQ(got[i].header.service, want[i].header.service);
    EXPECT_EQ(got[i].header.msg_id, want[i].header.msg_id);
    EXPECT_EQ(got[i].header.msg_size, want[i].header.msg_size);
    EXPECT_EQ(got[i].header.txn_id, want[i].header.txn_id);
    EXPECT_EQ(got[i].body, want[i].body);
  }
}

// After the closing variant has closed the connection, the next command opens a new one on the
// main thread before it writes, and its request goes out on that connection.
void expect_reopen_on_next_command(Rig& rig, int connection) {
  ASSERT_TRUE(rig.sim.wait_for_disconnect(5s)) << "the failed write closed the connection";
  const Outcome probe = rig.run(command_frame(27, {0, 2}));
  EXPECT_THAT(probe.lines, ::testing::ElementsAre("process_message: 27", "libsensor1: open -> 0",
                                                  "sensor1_open_or_reopen: sensor1_open success\n",
                                                  "get_handle_for_sensor: id:0\n"));
  auto r = rig.sim.next_request(5s);
  ASSERT_TRUE(r);
  EXPECT_EQ(r->header.msg_id, 64);
  EXPECT_EQ(r->connection, connection);
}

TEST(RequestFaultMatrix, EveryRequestSurvivesAllocationAndWriteFailures) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  int connection = 1;
  for (const Kind& kind : kinds()) {
    SCOPED_TRACE(kind.name);
    const uint32_t count = kind.requests;

    // Nothing fails: the reference run.
    const Outcome healthy = rig.run(kind.command);
    const std::vector<Request> sent = take_requests(rig.sim, kind.requests);
    ASSERT_EQ(sent.size(), kind.requests) << rig.daemon->output();
    std::optional<KernelFrame> answer;
    if (kind.callback_frame >= 0) {
      answer = rig.callback_frame(static_cast<uint16_t>(kind.callback_frame), 5s);
      ASSERT_TRUE(answer);
    }

    // The allocation fails: the failure line, nothing written, and the reply only where it is
    // built from the stored results.
    ASSERT_TRUE(rig.sim.fault(FaultOp::kAlloc, kAllocError, count));
    const Outcome alloc = rig.run(kind.command);
    EXPECT_EQ(alloc.lines, kind.alloc);
    if (kind.reply_after_alloc) {
      EXPECT_EQ(raw_frames(alloc), raw_frames(healthy));
      EXPECT_FALSE(alloc.frames.empty());
    } else {
      EXPECT_TRUE(alloc.frames.empty());
    }

    // The write returns 11: the request goes out and everything happens as without a fault.
    ASSERT_TRUE(rig.sim.fault(FaultOp::kWrite, 11, count));
    const Outcome would_block = rig.run(kind.command);
    EXPECT_EQ(without_race(would_block.lines), without_race(healthy.lines));
    EXPECT_EQ(raw_frames(would_block), raw_frames(healthy));
    expect_same_requests(take_requests(rig.sim, kind.requests), sent);
    if (answer) {
      auto again = rig.callback_frame(answer->type, 5s);
      ASSERT_TRUE(again);
      EXPECT_EQ(again->raw, answer->raw);
    }

    // The write fails and the close succeeds.
    ASSERT_TRUE(rig.sim.fault(FaultOp::kWrite, kWriteError, 1));
    const Outcome failed = rig.run(kind.write_error_command.value_or(kind.command));
    EXPECT_EQ(failed.lines, kind.write_error);
    if (kind.reply_after_write) {
      EXPECT_EQ(raw_frames(failed), raw_frames(healthy));
      EXPECT_FALSE(failed.frames.empty());
    } else {
      EXPECT_TRUE(failed.frames.empty());
    }
    if (!kind.requests_after_write_error.empty()) {
      ++connection;
      const auto after =
          take_requests(rig.sim, static_cast<uint32_t>(kind.requests_after_write_error.size()));
      for (size_t i = 0; i < after.size(); ++i) {
        EXPECT_EQ(after[i].connection, connection);
        EXPECT_EQ(after[i].header.msg_id, kind.requests_after_write_error[i]);
      }
    } else if (kind.closing) {
      expect_reopen_on_next_command(rig, ++connection);
    } else {
      EXPECT_EQ(rig.sim.current_connection(), connection);
    }
  }
  // No request went out that the cases did not expect: the next one is this last command's.
  rig.run(command_frame(27, {0, 2}));
  auto last = rig.sim.next_request(5s);
  ASSERT_TRUE(last);
  EXPECT_EQ(last->header.msg_id, 64);
  EXPECT_EQ(last->connection, connection);
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
    ASSERT_TRUE(rig.sim.fault(FaultOp::kWrite, kWriteError, 1));
    ASSERT_TRUE(rig.sim.fault(FaultOp::kClose, status, 1));
    const std::vector<uint8_t> command = kind.write_error_command.value_or(kind.command);
    ASSERT_TRUE(rig.kernel.send(command));
    EXPECT_EQ(rig.daemon->wait_exit(10s), status);
    const std::string last = "sensor1_close returned " + std::to_string(status) + "\n";
    ASSERT_TRUE(rig.daemon->wait_for(last, 5s)) << rig.daemon->output();
    // The lines up to the write failure are those of the closing run above; then the close
    // with its result, and the process ends.
    Lines expected;
    for (const std::string& l : kind.write_error) {
      if (l == "libsensor1: close -> 0") break;
      expected.push_back(l);
    }
    expected.push_back("libsensor1: close -> " + std::to_string(status));
    expected.push_back(last);
    Lines main = rig.lines_of_thread(rig.daemon->pid());
    auto walk = std::find(main.begin(), main.end(), expected.front());
    ASSERT_NE(walk, main.end());
    EXPECT_EQ(Lines(walk, main.end()), expected);
    for (const KernelFrame& f : rig.kernel.drain(0ms)) {
      EXPECT_FALSE(is_reply_frame(f.type)) << "no reply after the failure, got type " << f.type;
    }
  }
}

}  // namespace
