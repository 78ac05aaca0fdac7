// Commands 35 and 22..32 against the simulated sensor processor: each request as it arrives,
// header and all 288 body bytes, the log lines around it, and the failures of allocation and
// write through the library's fault knobs.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <vector>

#include "daemon_fixture.h"

using kestrel_sim::FaultOp;
using kestrel_sim::Request;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

namespace {

const uint8_t kLightSuid[16] = {0x33, 0xfc, 0x91, 0xdc, 0xc8, 0x0c, 0x41, 0xf2,
                                0xa3, 0xf2, 0xce, 0xd5, 0xe2, 0x9e, 0xb7, 0x8b};

std::vector<uint8_t> words_bytes(const std::vector<int32_t>& words) {
  std::vector<uint8_t> b(words.size() * 4);
  if (!words.empty()) memcpy(b.data(), words.data(), b.size());
  return b;
}

// The whole daf_request body the light sensor's driver should receive.
std::vector<uint8_t> daf_body(uint32_t request_id, const std::vector<uint8_t>& data) {
  std::vector<uint8_t> b(288, 0);
  memcpy(b.data(), kLightSuid, 16);
  memcpy(b.data() + 16, &request_id, 4);
  b[20] = 1;
  const uint32_t length = static_cast<uint32_t>(data.size());
  memcpy(b.data() + 24, &length, 4);
  if (!data.empty()) memcpy(b.data() + 28, data.data(), data.size());
  return b;
}

// A bulk-data frame: sensor_type, the length word, then the bytes the frame carries.
std::vector<uint8_t> bigdata_frame(uint16_t command, int32_t sensor_type, int32_t length,
                                   const std::vector<uint8_t>& data) {
  std::vector<uint8_t> payload = words_bytes({sensor_type, length});
  payload.insert(payload.end(), data.begin(), data.end());
  return command_frame_bytes(command, payload);
}

std::vector<uint8_t> counting_bytes(size_t n) {
  std::vector<uint8_t> b(n);
  for (size_t i = 0; i < n; ++i) b[i] = static_cast<uint8_t>(i * 7 + 1);
  return b;
}

class HiddenHoleTest : public DaemonFixture {
 protected:
  Request next_request() {
    const auto r = sim->next_request(2000ms);
    EXPECT_TRUE(r.has_value()) << "no request arrived";
    return r.value_or(Request{});
  }

  void expect_daf(const Request& r, uint8_t txn_id, const std::vector<uint8_t>& body) {
    EXPECT_EQ(r.header.service, 44u);
    EXPECT_EQ(r.header.msg_id, 32);
    EXPECT_EQ(r.header.msg_size, 288);
    EXPECT_EQ(r.header.txn_id, txn_id);
    EXPECT_EQ(r.body, body);
  }

  // KESTRELD lines since the last call, without the dispatcher's own.
  std::vector<std::string> take_lines() {
    std::vector<std::string> out;
    for (const std::string& m : lines()) {
      if (m.rfind("process_message", 0) != 0) out.push_back(m);
    }
    log->clear();
    return out;
  }

  // Opens the connection with one bulk-data request, so that faults can be set on it.
  void open_connection() {
    dispatch(bigdata_frame(26, 4, 1, {0x5a}));
    expect_daf(next_request(), 123, daf_body(100005, {0x5a}));
    take_lines();
  }

  std::vector<std::string> coefficient_lines(const std::vector<int32_t>& w) {
    const char* names[] = {"sensor_type", "d_factor", "r_coef",    "g_coef",  "b_coef",
                           "c_coef",      "ct_coef",  "ct_offset", "th_high", "th_low"};
    std::vector<std::string> out;
    for (size_t i = 0; i < 10; ++i) {
      out.push_back(std::string("set_hidden_hole_data ") + names[i] + ":" + std::to_string(w[i]) +
                    "\n");
    }
    return out;
  }
};

TEST_F(HiddenHoleTest, CoefficientsGoOutUnchangedAsRequest100010) {
  const std::vector<int32_t> w = {4, 1, 2, 3, 4, 5, 6, 7, 8, 9};
  command(35, w);
  expect_daf(next_request(), 123, daf_body(100010, words_bytes({1, 2, 3, 4, 5, 6, 7, 8, 9})));
  std::vector<std::string> expected = {"sensor1_open_or_reopen: sensor1_open success\n",
                                       "get_handle_for_sensor: id:4\n"};
  for (const std::string& l : coefficient_lines(w)) expected.push_back(l);
  expected.push_back("set_hidden_hole_data: sensor_type = 40 txn_id = 123\n");
  EXPECT_THAT(take_lines(), ElementsAreArray(expected));

  // Negative values and a sensor_type outside the table pass through as they are.
  const std::vector<int32_t> n = {-1, -1, -2, -300, -4, INT32_MIN, -6, -7, -8, INT32_MAX};
  command(35, n);
  const Request r = next_request();
  EXPECT_EQ(r.connection, 1);
  expect_daf(r, 123,
             daf_body(100010, words_bytes({-1, -2, -300, -4, INT32_MIN, -6, -7, -8, INT32_MAX})));
  expected = coefficient_lines(n);
  expected.push_back("set_hidden_hole_data: sensor_type = -1 txn_id = 123\n");
  EXPECT_THAT(take_lines(), ElementsAreArray(expected));
}

TEST_F(HiddenHoleTest, WriteErrorsOtherThanElevenReleaseTheBodyAndCarryOn) {
  open_connection();
  const std::vector<int32_t> w = {5, 10, 20, 30, 40, 50, 60, 70, 80, 90};

  // 11 counts as sent: the request arrives and no error is logged.
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 11, 1));
  command(35, w);
  expect_daf(next_request(), 123,
             daf_body(100010, words_bytes({10, 20, 30, 40, 50, 60, 70, 80, 90})));
  std::vector<std::string> expected = coefficient_lines(w);
  expected.push_back("set_hidden_hole_data: sensor_type = 40 txn_id = 123\n");
  EXPECT_THAT(take_lines(), ElementsAreArray(expected));

  // Any other result: the error line, and the closing line all the same.
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  command(35, w);
  expected = coefficient_lines(w);
  expected.push_back("[DAF][set_hidden_hole_data]sensor1_write -error  5 5\n");
  expected.push_back("set_hidden_hole_data: sensor_type = 40 txn_id = 123\n");
  EXPECT_THAT(take_lines(), ElementsAreArray(expected));

  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  dispatch(bigdata_frame(24, 4, 2, {1, 2}));
  EXPECT_THAT(take_lines(), ElementsAre("send_bigdata: type:24, id:40",
                                        "[DAF][send_bigdata]sensor1_write -error  5 4\n"));

  // Nothing went out for the failed writes, and the connection is still the first one.
  dispatch(bigdata_frame(25, 4, 1, {9}));
  const Request r = next_request();
  EXPECT_EQ(r.connection, 1);
  expect_daf(r, 123, daf_body(100002, {9}));
}

TEST_F(HiddenHoleTest, AllocationFailureLogsOnlyItsLine) {
  open_connection();
  ASSERT_TRUE(sim->fault(FaultOp::kAlloc, 12, 1));
  command(35, {4, 1, 2, 3, 4, 5, 6, 7, 8, 9});
  EXPECT_THAT(take_lines(), ElementsAre("get_raw error get_raw_data returned 12\n"));

  ASSERT_TRUE(sim->fault(FaultOp::kAlloc, 12, 1));
  dispatch(bigdata_frame(28, 4, 1, {7}));
  EXPECT_THAT(take_lines(), ElementsAre("send_bigdata sensor1_alloc_msg_buf error:12\n"));

  dispatch(bigdata_frame(29, 4, 1, {8}));
  expect_daf(next_request(), 167, daf_body(100007, {8}));
}

TEST_F(HiddenHoleTest, EachBulkDataCommandHasItsRequestAndTransactionId) {
  struct {
    uint16_t command;
    uint32_t request_id;
    uint8_t txn_id;
  } cases[] = {{24, 100001, 123}, {25, 100002, 123}, {23, 100003, 123},
               {22, 100004, 123}, {26, 100005, 123}, {28, 100006, 167},
               {29, 100007, 167}, {31, 100008, 168}, {32, 100009, 168}};
  const std::vector<uint8_t> data = {0x01, 0x02, 0x03, 0x04};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.command);
    dispatch(bigdata_frame(c.command, 5, 4, data));
    expect_daf(next_request(), c.txn_id, daf_body(c.request_id, data));
    const std::vector<std::string> l = take_lines();
    ASSERT_FALSE(l.empty());
    EXPECT_EQ(l.back(), "send_bigdata: type:" + std::to_string(c.command) + ", id:40");
  }

  // An out-of-range sensor_type changes only the logged id.
  dispatch(bigdata_frame(32, -1, 4, data));
  expect_daf(next_request(), 168, daf_body(100009, data));
  EXPECT_THAT(take_lines(), ElementsAre("send_bigdata: type:32, id:-1"));
}

TEST_F(HiddenHoleTest, DataLengthsFromNoneToTheWholeField) {
  dispatch(bigdata_frame(24, 4, 0, {}));
  expect_daf(next_request(), 123, daf_body(100001, {}));

  // Bytes the frame carries beyond the length are not forwarded.
  dispatch(bigdata_frame(22, 4, 4, counting_bytes(12)));
  expect_daf(next_request(), 123, daf_body(100004, counting_bytes(4)));

  dispatch(bigdata_frame(31, 4, 256, counting_bytes(256)));
  expect_daf(next_request(), 168, daf_body(100008, counting_bytes(256)));
}

TEST_F(HiddenHoleTest, LengthsTheRequestCannotHoldAreRefusedWithOneLine) {
  dispatch(bigdata_frame(24, 4, -1, {}));
  dispatch(bigdata_frame(23, 4, 257, counting_bytes(260)));
  dispatch(bigdata_frame(32, 4, INT32_MIN, counting_bytes(4)));
  // A length beyond its own frame, with another frame right behind it in the datagram: the
  // bytes of the second frame are not taken as data, and the second frame still runs.
  std::vector<uint8_t> datagram = bigdata_frame(28, 4, 8, {1, 2, 3, 4});
  const std::vector<uint8_t> second = bigdata_frame(22, 4, 2, {0xaa, 0xbb});
  datagram.insert(datagram.end(), second.begin(), second.end());
  dispatch(datagram);
  for (const LogRecord& r : log->records()) {
    if (r.message.find("refused") != std::string::npos) {
      EXPECT_EQ(r.priority, 6);
    }
  }

  EXPECT_THAT(
      take_lines(),
      ElementsAre(
          "send_bigdata: command 24 refused: data length -1 (frame carries 0 bytes, at most 256)",
          "send_bigdata: command 23 refused: data length 257 (frame carries 260 bytes, at most "
          "256)",
          "send_bigdata: command 32 refused: data length -2147483648 (frame carries 4 bytes, at "
          "most 256)",
          "send_bigdata: command 28 refused: data length 8 (frame carries 4 bytes, at most 256)",
          "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:4\n",
          "send_bigdata: type:22, id:40"));
  // The first request to arrive is the second frame's.
  expect_daf(next_request(), 123, daf_body(100004, {0xaa, 0xbb}));
}

}  // namespace
