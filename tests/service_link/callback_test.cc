// The service callback on the test's thread, as the library calls it: the entry and exit rules,
// each response's lines and frames byte for byte, test results into the store and the waiter,
// samples and DAF data out as frames of type 2, and bodies shorter than their layout refused.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdio.h>
#include <string.h>

#include <array>
#include <limits>
#include <string>
#include <utility>
#include <vector>

#include "daemon_fixture.h"
#include "sensor1_host.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"
#include "service_link/sample_conversion.h"
#include "service_link/service_callback.h"

using kestrel_sim::daf_indication_body;
using kestrel_sim::sample_indication_body;
using kestrel_sim::test_indication_body;
using ::testing::Each;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

namespace {

using Bytes = std::vector<uint8_t>;
using Logged = std::pair<int, std::string>;  // priority, message

void put32(Bytes& b, size_t offset, int32_t v) {
  memcpy(b.data() + offset, &v, 4);
}

std::vector<int32_t> count_from(int32_t first, size_t n) {
  std::vector<int32_t> w(n);
  for (size_t i = 0; i < n; ++i) w[i] = first + static_cast<int32_t>(i);
  return w;
}

Bytes resized(Bytes b, size_t n) {
  b.resize(n);
  return b;
}

// The code and six values of a sample_frame; the frame is poisoned first, so values a row does
// not set must come out zero.
std::vector<int32_t> convert(uint8_t id, uint8_t data_type, int32_t x, int32_t y, int32_t z,
                             mag_sensitivity_values s = {1.0f, 1.0f, 1.0f}) {
  sample_frame f;
  memset(&f, 0x5a, sizeof f);
  convert_sample(id, data_type, x, y, z, s, &f);
  return {f.code, f.value[0], f.value[1], f.value[2], f.value[3], f.value[4], f.value[5]};
}

TEST(SampleConversionTest, EveryRowOfTheTable) {
  EXPECT_THAT(convert(10, 0, 1000, -1000, 500), ElementsAre(1, -61, 61, -30, 0, 0, 0));
  EXPECT_THAT(convert(0, 0, 65536, 65536, 65536), ElementsAre(0, 417, 417, -417, 0, 0, 0));
  EXPECT_THAT(convert(0, 0, 65536, 131072, 0), ElementsAre(0, 835, 417, 0, 0, 0, 0));
  EXPECT_THAT(convert(20, 0, 65536, 65536, 65536), ElementsAre(2, 666, 666, -666, 0, 0, 0));
  EXPECT_THAT(convert(20, 0, 65536, 65536, 65536, {0.5f, 1.0f, 0.25f}),
              ElementsAre(2, 666, 1333, -2666, 0, 0, 0));
  EXPECT_THAT(convert(30, 0, 123456, -5, 9), ElementsAre(3, 0, 0, 0, 0, 0, 0));
  EXPECT_THAT(convert(40, 0, 32768, 7, 7), ElementsAre(5, 0, 0, 0, 0, 0, 0));
  EXPECT_THAT(convert(40, 0, -65536, 7, 7), ElementsAre(5, 2, 0, 0, 0, 0, 0));
  EXPECT_THAT(convert(60, 0, 131072, -65536, 70000), ElementsAre(6, 2, -1, 1, 0, 0, 4464));
  EXPECT_THAT(convert(0, 1, 196608, -65536, 70000), ElementsAre(4, 3, -1, 1, 0, 0, 0));
  EXPECT_THAT(convert(99, 0, 65536, 65536, 65536), ElementsAre(-1, 0, 0, 0, 0, 0, 0));
}

TEST(SampleConversionTest, PrecisionAndSaturation) {
  // 784532 * 417.67575 / 65536 is 4999.99987 in double, exactly 5000 from the single product.
  EXPECT_EQ(convert(0, 0, 0, 784532, 0)[1], 5000);
  // 16777249 becomes 16777248 in single precision: 170666.99 (not 170667.0009), low half -25942.
  EXPECT_EQ(convert(20, 0, 16777249, 0, 0)[2], -25942);
  // A sensitivity still 0: infinite quotients saturate to the 32-bit limits, 0/0 is NaN.
  EXPECT_THAT(convert(20, 0, 65536, -65536, 0, {0.0f, 0.0f, 0.0f}),
              ElementsAre(2, 0, -1, 0, 0, 0, 0));
  EXPECT_EQ(to_frame_value(70000.0), 4464);
  EXPECT_EQ(to_frame_value(2147483647.5), -1);
  EXPECT_EQ(to_frame_value(-2147483648.5), 0);
  EXPECT_EQ(to_frame_value(std::numeric_limits<double>::quiet_NaN()), 0);
}

class CallbackTest : public DaemonFixture {
 protected:
  // A body from the library's allocator whose size is the header's msg_size; empty means null.
  void deliver(int type, uint32_t service, int32_t msg_id, uint8_t txn, const Bytes& body) {
    sensor1_msg_header_s hdr = {service, msg_id, static_cast<uint16_t>(body.size()), txn};
    void* msg = nullptr;
    if (!body.empty()) {
      msg = sensor1_host_alloc_body(body.size());
      memcpy(msg, body.data(), body.size());
    }
    rcv_test_msg(sensor1_callback_data(), &hdr, type, msg);
  }
  std::vector<Logged> logged() const {
    std::vector<Logged> out;
    for (const LogRecord& r : log->records()) {
      if (r.tag == "KESTRELD") out.emplace_back(r.priority, r.message);
    }
    return out;
  }
  Bytes payload(uint16_t type) {
    auto f = kernel->receive_type(type, 2000ms);
    EXPECT_TRUE(f) << "no frame of type " << type;
    return f ? f->payload : Bytes{};
  }
};

TEST_F(CallbackTest, EntryRules) {
  void* body = sensor1_host_alloc_body(4);
  const long outstanding = sensor1_host_outstanding_bodies();
  rcv_test_msg(sensor1_callback_data(), nullptr, 1, body);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), outstanding) << "without a header, nothing freed";
  sensor1_free_msg_buf(nullptr, body);
  check_bodies_released = false;

  deliver(7, 0, 2, 2, Bytes(8, 1));  // freed: the fixture's leak check sees it
  deliver(251, 0, 0, 0, {});
  EXPECT_THAT(logged(), ElementsAre(Logged{6, "rcv_test_msg: received NULL msg_hdr_ptr! type: 1"},
                                    Logged{5, "rcv_test_msg: Received unknown message type: 7"},
                                    Logged{6, "\n received RETRY_OPEN!!!\n"}));
}

TEST_F(CallbackTest, LoggedResponses) {
  auto check = [&](uint32_t service, int32_t msg_id, uint8_t txn, const Bytes& body,
                   const std::vector<Logged>& expected) {
    log->clear();
    deliver(1, service, msg_id, txn, body);
    EXPECT_THAT(logged(), ElementsAreArray(expected)) << "service " << service << " msg " << msg_id;
  };
  Bytes states(196, 0);
  for (size_t i = 0; i < 12; ++i) states[4 + 16 * i] = 255;
  check(0, 64, 0, states, {});
  states[0] = 1;  // not consulted
  const Bytes first = {5, 0x0a, 0x01, 0xff, 0x00, 9, 9, 9, 9, 9, 9, 9, 0x0c, 0xd0, 9, 9};
  const Bytes last = {200, 0x12, 0x34, 0x56, 0x78, 0, 0, 0, 0, 0, 0, 0, 0x9a, 0xbc, 0, 0};
  memcpy(&states[4], first.data(), 16);
  memcpy(&states[4 + 16 * 11], last.data(), 16);
  check(0, 64, 0, states,
        {{4, "STATE: Type-  5  a 1ff 0  cd0"}, {4, "STATE: Type-200 12345678 9abc"}});

  check(0, 38, 0, {1, 4}, {{4, "SNS_SMGR_CAL_RESET_RESP_V01 - 1, 4"}});
  check(44, 32, 123, {0, 0}, {});
  check(0, 32, 123, {0, 0}, {{6, "rcv_test_msg: service_number:0"}});
  check(44, 32, 7, {1, 4}, {{6, "rcv_test_msg: Response: 1, Error: 4"}});
  check(0, 11, 6, {1, 4}, {{6, "rcv_test_msg: Response: 1, Error: 4"}});
  check(0, 11, 6, {0, 4}, {});
  const Bytes report = {0, 0, 0, 0, 0, 0, 0, 0, 20};
  check(0, 2, 2, report,
        {{6, "SNS_SMGR_REPORT_REQ_V01 - SensorId = 20 txn_id = 2 Report id=0 status = 0"}});
  check(13, 2, 9, report,
        {{4, "process_smgr_register_read_resp: Enter"},
         {6, "process_smgr_register_read_resp: Cannot parse msg id 2"},
         {6, "SNS_SMGR_REPORT_REQ_V01 - SensorId = 20 txn_id = 9 Report id=0 status = 0"}});
  check(13, 5, 9, {2, 1}, {{6, "rcv_test_msg: Response: 2, Error: 1"}});
  EXPECT_FALSE(kernel->receive(50ms)) << "nothing goes to the kernel";
}

TEST_F(CallbackTest, ThresholdRepliesFillTheirOwnPair) {
  Bytes body(28, 0);
  body[0] = 1;  // relayed whatever the result says
  put32(body, 12, 5);
  put32(body, 16, -3);
  put32(body, 20, 7);
  put32(body, 24, -9);
  deliver(1, 44, 32, 167, resized(body, 20));
  auto f = kernel->receive_type(30, 2000ms);
  ASSERT_TRUE(f);
  EXPECT_THAT(f->raw, ElementsAre(32, 0, 0, 0, 30, 0, 0, 0, 0, 0, 0, 0, 0x20, 0x4e, 0, 0,  //
                                  5, 0, 0, 0, 0xfd, 0xff, 0xff, 0xff, 0, 0, 0, 0, 0, 0, 0, 0));
  deliver(1, 44, 32, 168, body);
  EXPECT_THAT(payload(33), ElementsAre(0, 0, 0, 0, 0, 0, 0, 0, 7, 0, 0, 0, 0xf7, 0xff, 0xff, 0xff));
  EXPECT_THAT(logged(), ElementsAre(Logged{4, "rcv_test_msg: high:5, low:-3"},
                                    Logged{4, "rcv_test_msg: hd_high:7, hd_low:-9"}));
}

TEST_F(CallbackTest, RegisterDumpSendsOneFrameThenItsLines) {
  for (const auto& [txn, index, first_address] :
       {std::array<unsigned, 3>{171, 2, 0x00}, std::array<unsigned, 3>{174, 5, 0x80}}) {
    log->clear();
    Bytes body(140, 0);
    body[0] = 3;  // relayed whatever the result says
    for (size_t i = 0; i < 128; ++i) body[12 + i] = static_cast<uint8_t>(255 - i * 3);
    deliver(1, 44, 32, static_cast<uint8_t>(txn), body);

    Bytes expected_payload = {static_cast<uint8_t>(index)};
    expected_payload.insert(expected_payload.end(), body.begin() + 12, body.end());
    expected_payload.resize(132);  // padding to 148 bytes
    EXPECT_THAT(payload(20), ElementsAreArray(expected_payload));

    std::vector<Logged> expected;
    char line[96];
    snprintf(line, sizeof line, "+++++++++++ Print Register Dump for %u Start +++++++++++", index);
    expected.emplace_back(4, line);
    for (unsigned i = 0; i < 128; ++i) {
      snprintf(line, sizeof line, "+++++++++++ Reg_addr[0x%2x] : value[0x%2x] +++++++++++",
               first_address + i, unsigned{body[12 + i]});
      expected.emplace_back(4, line);
    }
    snprintf(line, sizeof line, "+++++++++++ Print Register Dump for %u End +++++++++++", index);
    expected.emplace_back(4, line);
    EXPECT_THAT(logged(), ElementsAreArray(expected));
  }
  EXPECT_EQ(logged()[1].second, "+++++++++++ Reg_addr[0x80] : value[0xff] +++++++++++");
}

TEST_F(CallbackTest, TestIndicationsStoreByIdAndAlwaysRaiseTheWaiter) {
  auto check = [&](const Bytes& body, const std::vector<Logged>& expected, int32_t status) {
    log->clear();
    reset_response_waiters_for_testing();
    set_test_status(-1);
    deliver(2, 0, 13, 0, body);
    EXPECT_THAT(logged(), ElementsAreArray(expected));
    EXPECT_EQ(test_status(), status);
    EXPECT_TRUE(command_waiter_arrived_for_testing());
  };
  // 76 bytes: exactly the 14 words the passed line shows.
  check(resized(test_indication_body(0, 6, 0, 0, 0, count_from(1, 14)), 76),
        {{4, "rcv_test_msg, SensorID:0, TestType:6"},
         {4,
          "rcv_test_msg: Registers Received test Passed1: 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, "
          "11, 12, 13, 14"},
         {4, "rcv_complete: result - 0\n"}},
        0);
  check(test_indication_body(20, 10, 5, 1, 3, count_from(1, 16)),
        {{4, "rcv_test_msg, SensorID:20, TestType:10"},
         {6, "rcv_test_msg: Received error in IND message: 3"},
         {4, "rcv_complete: result - 1\n"}},
        1);
  std::vector<int32_t> mag = count_from(1, 16);
  mag[14] = -1;
  EXPECT_THAT(factory_state().mag_result, ElementsAreArray(mag));
  check(test_indication_body(20, 6, 5, 0, 3, count_from(1, 16)),
        {{4, "rcv_test_msg, SensorID:20, TestType:6"},
         {6, "rcv_test_msg: Message indicates error w/o code (-1)"},
         {4, "rcv_complete: result - -1\n"}},
        -1);
  mag = count_from(1, 16);
  mag[0] = -1;
  EXPECT_THAT(factory_state().mag_result, ElementsAreArray(mag));

  deliver(2, 0, 13, 0, test_indication_body(10, 1, 0, 0, 0, count_from(100, 14)));
  deliver(2, 0, 13, 0, test_indication_body(30, 3, 0, 0, 0, count_from(300, 14)));
  const factory_results before = factory_state();
  EXPECT_THAT(before.accel_result, ElementsAreArray(count_from(1, 8)));
  EXPECT_THAT(before.gyro_result, ElementsAreArray(count_from(100, 12)));
  EXPECT_THAT(before.pressure_result, ElementsAre(300, 301));

  check(test_indication_body(50, 6, 5, 0, 0, count_from(500, 16)),
        {{4, "rcv_test_msg, SensorID:50, TestType:6"},
         {6, "rcv_test_msg: Message indicates error w/o code (-1)"},
         {6, "rcv_test_msg: wrong SensorID 50"},
         {4, "rcv_complete: result - -1\n"}},
        -1);
  const factory_results after = factory_state();
  EXPECT_EQ(memcmp(&before, &after, offsetof(factory_results, test_status)), 0) << "nothing stored";
}

TEST_F(CallbackTest, SamplesAndDafDataGoOutAsFramesOfTypeTwo) {
  set_mag_sensitivity(0.5f, 1.0f, 1.0f);
  deliver(2, 0, 3, 0, sample_indication_body(20, 0, 65536, 65536, 65536));
  EXPECT_THAT(payload(2),
              ElementsAre(2, 0, 0, 0, 0x9a, 0x02, 0x35, 0x05, 0x66, 0xfd, 0, 0, 0, 0, 0, 0));
  const std::array<int32_t, 6> d = {10, 11, 12, 13, 70000, -2};
  deliver(2, 44, 33, 0, daf_indication_body(61, 1, 24, d));
  EXPECT_THAT(payload(2),
              ElementsAre(4, 0, 0, 0, 11, 0, 12, 0, 13, 0, 10, 0, 0x70, 0x11, 0xfe, 0xff));
  deliver(2, 44, 33, 0, daf_indication_body(51, 1, 8, d));
  EXPECT_THAT(payload(2), ElementsAre(5, 0, 0, 0, 10, 0, 11, 0, 0, 0, 0, 0, 0, 0, 0, 0));
  EXPECT_THAT(logged(), IsEmpty());

  // Invalid or short DAF data, or another code: logged (or not), and an empty frame all the same.
  deliver(2, 44, 33, 0, daf_indication_body(61, 1, 20, d));
  deliver(2, 44, 33, 0, daf_indication_body(51, 0, 8, d));
  deliver(2, 44, 33, 0, daf_indication_body(99, 1, 24, d));
  for (int i = 0; i < 3; ++i) EXPECT_THAT(payload(2), Each(0));
  EXPECT_THAT(logged(), ElementsAre(Logged{6,
                                           "[DAF]daf_test: Unexpected error when parsing DAF ALS "
                                           "& RGB Polling IndicationMsg! valid 1 len 20\n"},
                                    Logged{6, "[DAF]msgPtr->IndicationMsg_valid false"}));
}

TEST_F(CallbackTest, ShortBodiesAreRefusedWithOneLine) {
  auto check = [&](int type, uint32_t service, int32_t msg_id, uint8_t txn, const Bytes& body,
                   const char* line) {
    log->clear();
    deliver(type, service, msg_id, txn, body);
    EXPECT_THAT(logged(), ElementsAre(Logged{6, line}));
  };
  check(1, 44, 32, 171, Bytes(139, 0),
        "rcv_test_msg: type 1 service 44 msg_id 32 txn 171: body of 139 bytes, needs 140");
  check(1, 44, 32, 168, Bytes(27, 0),
        "rcv_test_msg: type 1 service 44 msg_id 32 txn 168: body of 27 bytes, needs 28");
  check(1, 0, 64, 0, Bytes(195, 0),
        "rcv_test_msg: type 1 service 0 msg_id 64 txn 0: body of 195 bytes, needs 196");
  check(1, 0, 2, 2, Bytes(8, 0),
        "rcv_test_msg: type 1 service 0 msg_id 2 txn 2: body of 8 bytes, needs 9");
  check(1, 0, 11, 6, {},
        "rcv_test_msg: type 1 service 0 msg_id 11 txn 6: body of 0 bytes, needs 1");

  set_test_status(-1);
  check(2, 0, 13, 0, resized(test_indication_body(0, 6, 0, 0, 0, {}), 75),
        "rcv_test_msg: type 2 service 0 msg_id 13 txn 0: body of 75 bytes, needs 76");
  check(2, 0, 13, 0, resized(test_indication_body(20, 10, 5, 1, 3, {}), 83),
        "rcv_test_msg: type 2 service 0 msg_id 13 txn 0: body of 83 bytes, needs 84");
  check(2, 0, 13, 0, resized(test_indication_body(50, 10, 5, 1, 3, {}), 13),
        "rcv_test_msg: type 2 service 0 msg_id 13 txn 0: body of 13 bytes, needs 14");
  check(2, 0, 3, 0, resized(sample_indication_body(0, 0, 1, 2, 3), 23),
        "rcv_test_msg: type 2 service 0 msg_id 3 txn 0: body of 23 bytes, needs 24");
  check(2, 44, 33, 0, resized(daf_indication_body(61, 1, 24, {}), 31),
        "rcv_test_msg: type 2 service 44 msg_id 33 txn 0: body of 31 bytes, needs 32");
  check(2, 44, 33, 0, resized(daf_indication_body(51, 1, 8, {}), 15),
        "rcv_test_msg: type 2 service 44 msg_id 33 txn 0: body of 15 bytes, needs 16");

  EXPECT_FALSE(kernel->receive(50ms)) << "nothing relayed";
  EXPECT_THAT(factory_state().mag_result, Each(0)) << "nothing stored";
  EXPECT_FALSE(command_waiter_arrived_for_testing());
  EXPECT_EQ(wait_for_response(), 0) << "the waiting command sees no response";
}

}  // namespace
