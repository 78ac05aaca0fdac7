// SPDX-License-Identifier: Apache-2.0
// Commands 35 and 22..32 against the simulated sensor processor: each request as it arrives,
// header and all 288 body bytes, the log lines around it, and the refused data lengths.
#include "request_fixture.h"

namespace request_test {
namespace {

// A bulk-data frame: sensor_type, the length word, then the bytes the frame carries.
Bytes bigdata(uint16_t command, int32_t length, const Bytes& data, int32_t sensor_type = 4) {
  Bytes payload = words({sensor_type, length});
  payload.insert(payload.end(), data.begin(), data.end());
  return build_frame(command, payload);
}

Bytes counting(size_t n) {
  Bytes b(n);
  for (size_t i = 0; i < n; ++i) b[i] = static_cast<uint8_t>(i * 7 + 1);
  return b;
}

auto light_request(uint8_t txn_id, uint32_t request_id, const Bytes& data) {
  return IsRequest(44, 32, txn_id, daf_request(kLightSuid, request_id, data));
}

using HiddenHoleTest = RequestTest;

TEST_F(HiddenHoleTest, CoefficientsGoOutUnchangedAsRequest100010) {
  const char* names[] = {"sensor_type", "d_factor", "r_coef",    "g_coef",  "b_coef",
                         "c_coef",      "ct_coef",  "ct_offset", "th_high", "th_low"};
  // Negative values and a sensor_type outside the table pass through as they are.
  for (const std::vector<int32_t>& w :
       {std::vector<int32_t>{4, 1, 2, 3, 4, 5, 6, 7, 8, 9},
        std::vector<int32_t>{-1, -1, -2, -300, -4, INT32_MIN, -6, -7, -8, INT32_MAX}}) {
    command(35, w);
    EXPECT_THAT(next(), light_request(123, 100010, words({w.begin() + 1, w.end()})));
    Lines expected;
    for (size_t i = 0; i < 10; ++i) {
      expected.push_back(std::string("set_hidden_hole_data ") + names[i] + ":" +
                         std::to_string(w[i]) + "\n");
    }
    expected.push_back(std::string("set_hidden_hole_data: sensor_type = ") +
                       (w[0] == 4 ? "40" : "-1") + " txn_id = 123\n");
    EXPECT_THAT(last_lines(11), ElementsAreArray(expected));
  }
}

TEST_F(HiddenHoleTest, EachBulkDataCommandForwardsItsBytesWithItsRequestAndTransactionId) {
  // command, request id, txn id, data length, bytes the frame carries (those beyond the length
  // are not forwarded)
  const std::tuple<uint16_t, uint32_t, uint8_t, int32_t, size_t> cases[] = {
      {24, 100001, 123, 0, 0},  {25, 100002, 123, 4, 4},     {23, 100003, 123, 4, 4},
      {22, 100004, 123, 4, 12}, {26, 100005, 123, 4, 4},     {28, 100006, 167, 4, 4},
      {29, 100007, 167, 4, 4},  {31, 100008, 168, 256, 256}, {32, 100009, 168, 4, 4}};
  for (const auto& [number, request_id, txn_id, length, carried] : cases) {
    dispatch(bigdata(number, length, counting(carried)));
    EXPECT_THAT(next(), light_request(txn_id, request_id, counting(length)));
    EXPECT_EQ(lines().back(), "send_bigdata: type:" + std::to_string(number) + ", id:40");
  }
  // An out-of-range sensor_type changes only the logged id.
  dispatch(bigdata(32, 4, counting(4), -1));
  EXPECT_THAT(next(), light_request(168, 100009, counting(4)));
  EXPECT_EQ(lines().back(), "send_bigdata: type:32, id:-1");
}

TEST_F(HiddenHoleTest, LengthsTheRequestCannotHoldAreRefusedWithOneLine) {
  dispatch(bigdata(24, -1, {}));
  dispatch(bigdata(23, 257, counting(260)));
  dispatch(bigdata(32, INT32_MIN, counting(4)));
  // A length beyond its own frame, with another frame right behind it in the datagram: the
  // bytes of the second frame are not taken as data, and the second frame still runs.
  Bytes datagram = bigdata(28, 8, {1, 2, 3, 4});
  const Bytes second = bigdata(22, 2, {0xaa, 0xbb});
  datagram.insert(datagram.end(), second.begin(), second.end());
  dispatch(datagram);
  for (const LogRecord& r : log->records()) {
    if (r.message.find("refused") != std::string::npos) {
      EXPECT_EQ(r.priority, 6);
    }
  }
  Lines expected;
  for (const char* refused : {"24 refused: data length -1 (frame carries 0",
                              "23 refused: data length 257 (frame carries 260",
                              "32 refused: data length -2147483648 (frame carries 4",
                              "28 refused: data length 8 (frame carries 4"}) {
    expected.push_back("process_message: " + std::string(refused, 2));
    expected.push_back(std::string("send_bigdata: command ") + refused + " bytes, at most 256)");
  }
  expected.insert(expected.end(),
                  {"process_message: 22", "sensor1_open_or_reopen: sensor1_open success\n",
                   "get_handle_for_sensor: id:4\n", "send_bigdata: type:22, id:40"});
  EXPECT_THAT(main_lines(), ElementsAreArray(expected));
  // The first request to arrive is the second frame's.
  EXPECT_THAT(next(), light_request(123, 100004, {0xaa, 0xbb}));
}

}  // namespace
}  // namespace request_test
