// SPDX-License-Identifier: Apache-2.0
// Register access and device controls: the magnetometer's fuse-ROM and register reads with their
// replies, the accelerometer's filter, the motor state and the register dumps.
#include "requests/register_access.h"
#include "request_fixture.h"

namespace request_test {
namespace {

using RegisterAccessTest = RequestTest;

// Payload of the magnetometer replies.
Bytes mag_reply(const std::vector<int32_t>& fuse_rom, const Bytes& registers, int32_t result) {
  Bytes b = words({2, fuse_rom[0], fuse_rom[1], fuse_rom[2], 0, 0, 0, 0, result});
  std::copy(registers.begin(), registers.end(), b.begin() + 16);
  return b;
}

TEST_F(RegisterAccessTest, MagnetometerReadsReplyWithTheTestStatusAsResult) {
  answer_tests(20, 9, {64, -128, 0, 7});
  command(11);
  EXPECT_THAT(next(), IsRequest(0, 13, 4, test_request(20, 9, 0, 0)));
  EXPECT_EQ(frame(11), daemon_frame(11, mag_reply({64, -128, 0}, {}, 0)));
  EXPECT_THAT(
      main_lines(),
      ElementsAre("process_message: 11",
                  "get_mag_register_data: sensor_type = 8, pdata_sensor_type:2, id=20, "
                  "send_to_kernel=1\n",
                  "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:8\n",
                  "get_mag_register_data: MAG Read Fuserom\n",
                  "get_mag_register_data: msg_hdr.msg_id = 0xd, id = 20\n",
                  "waiting for response IN - timeout=8000", "wait_for_response: response received.",
                  "get_mag_register_data: id == ADSP_FACTORY_MAG_READ_FUSE_ROM, result(0)"));

  // A register read that failed with an error code: result 1, the low byte of each word.
  answer_tests(20, 10, {0x1ff, -2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 0x100}, 3);
  log->clear();
  command(12);
  EXPECT_EQ(next().body, test_request(20, 10, 0, 0));
  EXPECT_EQ(main_lines().at(2), "get_mag_register_data: MAG Read Registers\n");
  const Bytes registers = {0xff, 0xfe, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 0};
  EXPECT_EQ(frame(12), daemon_frame(12, mag_reply({0, 0, 0}, registers, 1)));

  // No answer: the same words, and -1 as the result.
  sim->set_request_hook(nullptr);
  command(12);
  next();
  EXPECT_EQ(frame(12), daemon_frame(12, mag_reply({0, 0, 0}, registers, -1)));
}

TEST_F(RegisterAccessTest, FilterResultFollowsTheReportedTestType) {
  // Command 15 asks for the filter on; the sensor reports test type 12, so frame 16 goes out.
  answer_tests(0, 11, {12, 1});
  command(15);
  EXPECT_EQ(next().body, test_request(0, 11, 1, 1));
  EXPECT_EQ(frame(16), daemon_frame(16, words({13, 0, 1})));
  EXPECT_EQ(main_lines().back(), "send_accel_lpf_result OUT: test type = 12, lpf_on_off = 1\n");

  // Command 16 asks for the filter off (code 13, TestType 12); a reported type 11 sends frame 15.
  answer_tests(0, 12, {11, 0});
  log->clear();
  command(16);
  EXPECT_EQ(next().body, test_request(0, 12, 1, 1));
  EXPECT_EQ(frame(15), daemon_frame(15, words({12, 0, 0})));
  EXPECT_THAT(
      main_lines(),
      ElementsAre("process_message: 16", "set_accel_lpf: sensor_type = 13, id = 0\n",
                  "set_accel_lpf: K6DS3 ACCEL LPF OFF\n",
                  "set_accel_lpf: msg_hdr.msg_id = 0xd, id = 0\n",
                  "waiting for response IN - timeout=8000", "wait_for_response: response received.",
                  "send_accel_lpf_result OUT: test type = 11, lpf_on_off = 0\n"));

  // An unknown code still sends the request, with TestType left zero.
  log->clear();
  set_accel_lpf(7);
  EXPECT_EQ(next().body, test_request(0xff, 0, 1, 1));
  EXPECT_THAT(main_lines(),
              ElementsAre("set_accel_lpf: sensor_type = 7, id = -1\n",
                          "set_accel_lpf: K6DS3 ACCEL LPF ON/OFF invalid sensor type\n",
                          "set_accel_lpf: msg_hdr.msg_id = 0xd, id = 255\n",
                          "waiting for response IN - timeout=8000",
                          "wait_for_response: response received."));
}

TEST_F(RegisterAccessTest, MotorStateRequests) {
  command(17);
  EXPECT_THAT(next(), IsRequest(44, 32, 7, daf_request(kAccelSuid, 100011, {1})));
  EXPECT_EQ(main_lines().back(), "set_accel_motor: Send Motor Enabled state done");

  log->clear();
  set_accel_motor(3);  // a code without a request id sends nothing built from unset values
  EXPECT_THAT(main_lines(),
              ElementsAre("set_accel_motor: invalid motor code 3, no request sent\n"));
  command(18);
  EXPECT_EQ(main_lines().back(), "set_accel_motor: Send Motor Disabled state done");
  EXPECT_EQ(next().body, daf_request(kAccelSuid, 100012, {0}));
  EXPECT_EQ(sim->requests().size(), 2u);
}

TEST_F(RegisterAccessTest, RegisterDumpRequests) {
  command(19, {1});  // no SUID for the gyroscope: the bytes stay zero
  EXPECT_THAT(
      main_lines(),
      ElementsAre("process_message: 19",
                  "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (1)",
                  "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:1\n",
                  "[getUUID] sensor_type error (1)\n", "dump_register: send DAF message to slpi"));
  EXPECT_THAT(next(), IsRequest(44, 32, 170, daf_request({}, 100015, {})));
  for (const auto& [sensor_type, suid] : {std::pair{0, kAccelSuid},
                                          {2, kMagSuid},
                                          {3, kPressureSuid},
                                          {4, kLightSuid},
                                          {5, kLightSuid}}) {
    command(19, {sensor_type});
    EXPECT_THAT(next(), IsRequest(44, 32, 169 + sensor_type, daf_request(suid, 100015, {})));
  }

  // Past 5 nothing is written: the dispatcher stops 6, dump_register the rest (after getUUID,
  // which knows 6, 7, 14 and 15).
  log->clear();
  command(19, {6});
  command(19, {-1});
  Lines expected = {"process_message: 19",
                    "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type error",
                    "process_message: 19",
                    "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type (-1)",
                    "[getUUID] sensor_type error (-1)\n",
                    "[DAF][dump_register] sensor_type error -1\n"};
  for (uint32_t sensor_type : {6, 7, 8, 14, 15, 16}) {
    dump_register(sensor_type);
    const std::string n = std::to_string(sensor_type);
    if (sensor_type == 8 || sensor_type == 16) {
      expected.push_back("[getUUID] sensor_type error (" + n + ")\n");
    }
    expected.push_back("[DAF][dump_register] sensor_type error " + n + "\n");
  }
  EXPECT_EQ(main_lines(), expected);
  command(19, {0});
  EXPECT_EQ(next().header.txn_id, 169);  // the first request after the refused ones
}

}  // namespace
}  // namespace request_test
