// SPDX-License-Identifier: Apache-2.0
// Every sensor1 request the daemon makes, through the fault knobs of the sensor1 stand-in: the
// allocation fails; the write returns 11 (EWOULDBLOCK, which counts as sent); the write fails
// with another error, after which the closing requests give up the connection (the next command
// opens a new one); and the write and the close both fail, which ends the process with the
// close's result as its exit status.
#include "kernel_channel/process_message.h"
#include "request_fixture.h"

namespace request_test {
namespace {

struct Kind {
  const char* name;
  Bytes command;
  uint32_t requests;  // written when nothing fails
  Lines alloc;        // the lines after the walk's own, every allocation failing
  Lines write_error;  // the same when the first write fails with 5
  int alloc_reply;    // frame type that still goes out after the allocation failure, or -1
  int write_reply;    // the same after the write failure
  bool closing;       // a failed write closes the connection
  std::optional<Bytes> write_command = std::nullopt;  // where another command reaches the write
};

std::string alloc(const std::string& name) {
  return "[" + name + "]sensor1_alloc_msg_buf error - 12\n";
}
std::string write5(const std::string& name) {
  return "[" + name + "]sensor1_write -error  5\n";
}

std::vector<Kind> kinds() {
  const std::string get_raw12 = "get_raw error get_raw_data returned 12\n";
  const std::string lpf = "set_accel_lpf: sensor_type = 12, id = 0\n";
  const std::string lpf_out = "send_accel_lpf_result OUT: test type = 0, lpf_on_off = 0\n";
  const std::string mag =
      "get_mag_register_data: sensor_type = 8, pdata_sensor_type:2, id=20, send_to_kernel=1\n";
  const Lines store = {"store_calib_data: Enter\n", "store_calib_data: sensor_type = 0 \n"};
  const std::string selftest = "get_selftest_result: sensor_type = 0, id = 0\n";
  Lines hidden_hole;
  const char* names[] = {"sensor_type", "d_factor", "r_coef",    "g_coef",  "b_coef",
                         "c_coef",      "ct_coef",  "ct_offset", "th_high", "th_low"};
  for (int i = 0; i < 10; ++i) {
    hidden_hole.push_back(std::string("set_hidden_hole_data ") + names[i] + ":" +
                          std::to_string(i == 0 ? 4 : i) + "\n");
  }
  // clang-format off
  return {
      {"get_status", build_command(0, {0}), 1, {alloc("get_status")}, {write5("get_status")},
       -1, -1, true},
      {"get_raw_data, sensor manager", build_command(1, {0}), 1, {alloc("get_raw_data")},
       {write5("get_raw_data"), "get_raw_data: sensor_type = 0 txn_id = 2\n"}, -1, -1, false},
      {"get_raw_data, light sensor", build_command(1, {4}), 1, {get_raw12},
       {"get_raw_data sensor_type:4\n", "[DAF][get_raw_data]sensor1_write -error  5 4\n",
        "get_raw_data: sensor_type = 40 txn_id = 123\n"}, -1, -1, false},
      {"stop_raw_data, sensor manager", build_command(3, {0}), 1, {alloc("stop_raw_data")},
       {"[stop_raw_data]sensor1_write -error  5 0\n",
        "stop_raw_data: sensor_type = 0 txn_id = 2\n"}, -1, 3, false},
      {"stop_raw_data, light sensor", build_command(3, {4}), 1, {get_raw12},
       {"stop_raw_data sensor_type:4\n", "[DAF][stop_raw_data]sensor1_write -error  5 4\n",
        "stop_raw_data: sensor_type = 40 txn_id = 123\n"}, -1, 3, false},
      {"store_calib_data", build_command(6, {0, 1}), 1, store + Lines{alloc("store_calib_data")},
       store + Lines{"store_calib_data: CAL(1)", "store_calib_data: SensorID:0, DataType:0",
                     write5("store_calib_data")}, -1, -1, true},
      {"get_selftest_result", build_command(8, {0}), 1, {selftest, alloc("get_selftest_result")},
       {selftest, "get_selftest_result: LSM6DSM ACCEL SELFTEST, TestType = (6)\n",
        "get_selftest_result: msg_hdr.msg_id = 0xd, id = 0\n", write5("get_selftest_result")},
       9, 9, true},
      // The reset after the magnetometer self test, and beside a magnetometer stream start: it
      // closes the connection the stream's request was taken on, which is taken anew.
      {"reset_mag_cal", build_command(8, {2}), 2,
       {"get_selftest_result: sensor_type = 2, id = 20\n", alloc("get_selftest_result"),
        "send_mag_selftest_result: id == SNS_SMGR_ID_MAG_V01", alloc("reset_mag_cal")},
       {"get_raw_data: Reset Mag Cal IN", write5("reset_mag_cal"),
        "get_raw_data: Reset Mag Cal OUT",
        "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:2\n",
        "get_raw_data: sensor_type = 20 txn_id = 2\n"}, 9, -1, true, build_command(1, {2})},
      {"get_mag_register_data", build_command(11), 1, {mag, alloc("get_mag_register_data")},
       {mag, "get_mag_register_data: MAG Read Fuserom\n",
        "get_mag_register_data: msg_hdr.msg_id = 0xd, id = 20\n", write5("get_mag_register_data")},
       -1, -1, true},
      {"set_accel_lpf", build_command(15), 1, {lpf, alloc("set_accel_lpf"), lpf_out},
       {lpf, "set_accel_lpf: K6DS3 ACCEL LPF ON\n", "set_accel_lpf: msg_hdr.msg_id = 0xd, id = 0\n",
        write5("set_accel_lpf"), lpf_out}, -1, -1, true},
      {"set_accel_motor", build_command(17), 1,
       {"set_accel_motor sensor1_alloc_msg_buf error:12\n"},
       {"[DAF][set_accel_motor]sensor1_write -error  5 14\n",
        "set_accel_motor: Send Motor Enabled state done"}, -1, -1, false},
      {"dump_register", build_command(19, {0}), 1,
       {"process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (0)",
        "dump_register sensor1_alloc_msg_buf error:12\n"},
       {"process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (0)",
        "[DAF][dump_register]sensor1_write error 5\n"}, -1, -1, false},
      {"send_bigdata", build_command(28, {4, 4, 0x04030201}), 1,
       {"send_bigdata sensor1_alloc_msg_buf error:12\n"},
       {"send_bigdata: type:28, id:40", "[DAF][send_bigdata]sensor1_write -error  5 4\n"},
       -1, -1, false},
      {"set_hidden_hole_data", build_command(35, {4, 1, 2, 3, 4, 5, 6, 7, 8, 9}), 1, {get_raw12},
       hidden_hole + Lines{"[DAF][set_hidden_hole_data]sensor1_write -error  5 4\n",
                           "set_hidden_hole_data: sensor_type = 40 txn_id = 123\n"}, -1, -1, false},
      {"get_sensor_state", build_command(27, {0, 2}), 1, {alloc("get_sensor_state")},
       {write5("get_sensor_state")}, -1, -1, true},
  };
  // clang-format on
}

using RequestFailuresTest = RequestTest;

TEST_F(RequestFailuresTest, EveryRequestSurvivesAllocationAndWriteFailures) {
  int connections = 1;
  for (const Kind& kind : kinds()) {
    SCOPED_TRACE(kind.name);
    ASSERT_NE(get_handle_for_sensor(0), nullptr);
    const int number = kind.command[4];
    const Lines walk = {"process_message: " + std::to_string(number)};
    const auto reply_is = [&](int type) {
      const std::vector<Frame> frames = kernel->drain(50ms);
      EXPECT_EQ(frames.size(), type < 0 ? 0u : 1u);
      if (!frames.empty()) {
        EXPECT_EQ(frames[0].type, type);
      }
    };
    sim->clear_requests();
    ASSERT_TRUE(sim->fault(FaultOp::kAlloc, 12, kind.requests));
    log->clear();
    dispatch(kind.command);
    EXPECT_EQ(main_lines(), walk + kind.alloc);
    reply_is(kind.alloc_reply);
    EXPECT_TRUE(sim->requests().empty()) << "nothing written";

    // 11 counts as sent: the request arrives and no error is logged.
    ASSERT_TRUE(sim->fault(FaultOp::kWrite, 11, kind.requests));
    log->clear();
    dispatch(kind.command);
    next();
    for (const std::string& l : main_lines()) EXPECT_EQ(l.find("error"), std::string::npos) << l;
    kernel->drain(50ms);

    ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
    log->clear();
    const Bytes& command = kind.write_command.value_or(kind.command);
    dispatch(command);
    EXPECT_EQ(main_lines(),
              Lines{"process_message: " + std::to_string(command[4])} + kind.write_error);
    reply_is(kind.write_reply);
    // The next command opens a new connection (the stream start at once).
    if (kind.closing && !kind.write_command) {
      EXPECT_TRUE(sim->wait_for_disconnect(2000ms)) << "the failed write closed the connection";
    }
    connections += kind.closing;
  }
  ASSERT_NE(get_handle_for_sensor(0), nullptr);
  EXPECT_EQ(sim->opened_connections(), connections);
}

TEST(RequestFailuresDeathTest, AFailedWriteWhoseCloseFailsEndsTheProcessWithTheCloseResult) {
  for (const Kind& kind : kinds()) {
    if (!kind.closing) continue;
    const Bytes command = kind.write_command.value_or(kind.command);
    expect_exit_on_failing_close(
        [&] {
          std::vector<uint8_t> buffer(1024, 0);
          std::copy(command.begin(), command.end(), buffer.begin());
          process_message(buffer.data(), static_cast<int32_t>(command.size()));
        },
        kind.name);
  }
}

}  // namespace
}  // namespace request_test
