// SPDX-License-Identifier: Apache-2.0
// The service callback on the test's thread, as the library calls it: the entry and exit rules,
// each response's lines and frames byte for byte, test results into the store and the waiter,
// samples and DAF data out as frames of type 2, and bodies shorter than their layout refused or
// logged as far as they go.
// The conversion arithmetic itself is tested on its own, in sample_conversion_test.cc.
#include <stdio.h>

#include <array>
#include <numeric>
#include <optional>
#include <tuple>

#include "callback_fixture.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"

using namespace ::testing;
using namespace kestrel_sim;

namespace {

std::vector<int32_t> count_from(int32_t first, size_t n) {
  std::vector<int32_t> w(n);
  std::iota(w.begin(), w.end(), first);
  return w;
}

Bytes resized(Bytes b, size_t n) {
  b.resize(n);
  return b;
}

TEST_F(CallbackTest, EntryRulesAndResponsesLoggedOrRelayed) {
  void* body = sensor1_host_alloc_body(4);
  const long outstanding = sensor1_host_outstanding_bodies();
  rcv_test_msg(sensor1_callback_data(), nullptr, 1, body);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), outstanding) << "without a header, nothing freed";
  sensor1_free_msg_buf(nullptr, body);

  Bytes states(196, 0);
  for (size_t i = 0; i < 12; ++i) states[4 + 16 * i] = 255;
  deliver(1, 0, 64, 0, states);  // empty records: nothing
  const Bytes first = {5, 0x0a, 0x01, 0xff, 0x00, 9, 9, 9, 9, 9, 9, 9, 0x0c, 0xd0, 9, 9};
  const Bytes last = {200, 0x12, 0x34, 0x56, 0x78, 0, 0, 0, 0, 0, 0, 0, 0x9a, 0xbc, 0, 0};
  std::copy(first.begin(), first.end(), states.begin() + 4);
  std::copy(last.begin(), last.end(), states.begin() + 4 + 16 * 11);
  deliver(1, 0, 64, 0, states);
  // The light sensor's thresholds, relayed whatever the result says: each reply fills its own
  // pair of the frame.
  Bytes threshold(28, 1);
  for (auto [at, v] : {std::pair{12, 5}, {16, -3}, {20, 7}, {24, -9}})
    memcpy(&threshold[at], &v, 4);
  deliver(1, 44, 32, 167, resized(threshold, 20));
  EXPECT_THAT(frame(30, true),
              ElementsAre(5, 0, 0, 0, 0xfd, 0xff, 0xff, 0xff, 0, 0, 0, 0, 0, 0, 0, 0));
  deliver(1, 44, 32, 168, threshold);
  EXPECT_THAT(frame(33, true),
              ElementsAre(0, 0, 0, 0, 0, 0, 0, 0, 7, 0, 0, 0, 0xf7, 0xff, 0xff, 0xff));

  const Bytes report = {0, 0, 0, 0, 0, 0, 0, 0, 20};
  deliver(1, 0, 38, 0, {1, 4});
  deliver(1, 44, 32, 123, {0, 0});  // nothing
  deliver(1, 0, 32, 123, {0, 0});
  deliver(1, 44, 32, 7, {1, 4});
  deliver(1, 0, 11, 6, {1, 4});
  deliver(1, 0, 11, 6, {0, 4});  // nothing
  deliver(1, 0, 2, 2, report);
  deliver(1, 13, 2, 9, report);
  deliver(1, 13, 5, 9, {2, 1});
  deliver(7, 0, 2, 2, Bytes(8, 1));  // freed: the fixture's leak check sees it
  deliver(251, 0, 0, 0, {});
  EXPECT_THAT(
      logged(),
      ElementsAre(
          Logged{6, "rcv_test_msg: received NULL msg_hdr_ptr! type: 1"},
          Logged{4, "STATE: Type-  5  a 1ff 0  cd0"}, Logged{4, "STATE: Type-200 12345678 9abc"},
          Logged{4, "rcv_test_msg: high:5, low:-3"},
          Logged{4, "rcv_test_msg: hd_high:7, hd_low:-9"},
          Logged{4, "SNS_SMGR_CAL_RESET_RESP_V01 - 1, 4"},
          Logged{6, "rcv_test_msg: service_number:0"},
          Logged{6, "rcv_test_msg: Response: 1, Error: 4"},
          Logged{6, "rcv_test_msg: Response: 1, Error: 4"},
          Logged{6, "SNS_SMGR_REPORT_REQ_V01 - SensorId = 20 txn_id = 2 Report id=0 status = 0"},
          Logged{4, "process_smgr_register_read_resp: Enter"},
          Logged{6, "process_smgr_register_read_resp: Cannot parse msg id 2"},
          Logged{6, "SNS_SMGR_REPORT_REQ_V01 - SensorId = 20 txn_id = 9 Report id=0 status = 0"},
          Logged{6, "rcv_test_msg: Response: 2, Error: 1"},
          Logged{5, "rcv_test_msg: Received unknown message type: 7"},
          Logged{6, "\n received RETRY_OPEN!!!\n"}));
  EXPECT_FALSE(kernel->next_frame(50ms)) << "nothing else goes to the kernel";
}

TEST_F(CallbackTest, TestIndicationsStoreByIdAndAlwaysRaiseTheWaiter) {
  // The lines between the first, with the id and TestType, and the last, with the status.
  auto check = [&](const Bytes& body, std::vector<Logged> lines, int32_t status) {
    log->clear();
    reset_response_waiters_for_testing();
    set_test_status(-1);
    deliver(2, 0, 13, 0, body);
    lines.insert(lines.begin(), {4, "rcv_test_msg, SensorID:" + std::to_string(body[0]) +
                                        ", TestType:" + std::to_string(body[4])});
    lines.emplace_back(4, "rcv_complete: result - " + std::to_string(status) + "\n");
    EXPECT_THAT(logged(), ElementsAreArray(lines));
    EXPECT_EQ(test_status(), status);
    EXPECT_TRUE(command_waiter_arrived_for_testing());
  };
  const Logged no_code = {6, "rcv_test_msg: Message indicates error w/o code (-1)"};
  // 76 bytes: exactly the 14 words the passed line shows.
  check(resized(test_indication_body(0, 6, 0, 0, 0, count_from(1, 14)), 76),
        {{4,
          "rcv_test_msg: Registers Received test Passed1: 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, "
          "11, 12, 13, 14"}},
        0);
  // A failed magnetometer test forces the word of its step to -1: 14 for TestType 10, 0 for 6.
  check(test_indication_body(20, 10, 5, 1, 3, count_from(1, 16)),
        {{6, "rcv_test_msg: Received error in IND message: 3"}}, 1);
  std::vector<int32_t> mag = count_from(1, 16);
  mag[14] = -1;
  EXPECT_THAT(factory_state().mag_result, ElementsAreArray(mag));
  check(test_indication_body(20, 6, 5, 0, 3, count_from(1, 16)), {no_code}, -1);
  std::tie(mag[0], mag[14]) = std::pair(-1, 15);
  EXPECT_THAT(factory_state().mag_result, ElementsAreArray(mag));

  deliver(2, 0, 13, 0, test_indication_body(30, 3, 0, 0, 0, count_from(300, 14)));
  const factory_results before = factory_state();
  EXPECT_THAT(before.accel_result, ElementsAreArray(count_from(1, 8)));
  EXPECT_THAT(before.pressure_result, ElementsAre(300, 301));
  check(test_indication_body(50, 6, 5, 0, 0, count_from(500, 16)),
        {no_code, {6, "rcv_test_msg: wrong SensorID 50"}}, -1);
  const factory_results after = factory_state();
  EXPECT_EQ(memcmp(&before, &after, offsetof(factory_results, test_status)), 0) << "nothing stored";
}

TEST_F(CallbackTest, SamplesAndDafDataGoOutAsFramesOfTypeTwo) {
  // The magnetometer, each axis by its own sensitivity: 666 for 1.0, 1333 for 0.5, 2666 for 0.25.
  set_mag_sensitivity(0.5f, 1.0f, 0.25f);
  deliver(2, 0, 3, 0, sample_indication_body(20, 0, 65536, 65536, 65536));
  EXPECT_THAT(frame(2, true),
              ElementsAre(2, 0, 0, 0, 0x9a, 0x02, 0x35, 0x05, 0x96, 0xf5, 0, 0, 0, 0, 0, 0));
  const std::array<int32_t, 6> d = {10, 11, 12, 13, 70000, -2};
  deliver(2, 44, 33, 0, daf_indication_body(61, 1, 24, d));
  EXPECT_THAT(frame(2, true),
              ElementsAre(4, 0, 0, 0, 11, 0, 12, 0, 13, 0, 10, 0, 0x70, 0x11, 0xfe, 0xff));
  deliver(2, 44, 33, 0, daf_indication_body(51, 1, 8, d));
  EXPECT_THAT(frame(2, true), ElementsAre(5, 0, 0, 0, 10, 0, 11, 0, 0, 0, 0, 0, 0, 0, 0, 0));
  EXPECT_THAT(logged(), IsEmpty());

  // Invalid or short DAF data, or another code: logged (or not), and an empty frame all the same.
  deliver(2, 44, 33, 0, daf_indication_body(61, 1, 20, d));
  deliver(2, 44, 33, 0, daf_indication_body(51, 0, 8, d));
  deliver(2, 44, 33, 0, daf_indication_body(99, 1, 24, d));
  for (int i = 0; i < 3; ++i) EXPECT_THAT(frame(2, true), Each(0));
  EXPECT_THAT(logged(), ElementsAre(Logged{6,
                                           "[DAF]daf_test: Unexpected error when parsing DAF ALS "
                                           "& RGB Polling IndicationMsg! valid 1 len 20\n"},
                                    Logged{6, "[DAF]msgPtr->IndicationMsg_valid false"}));
}

TEST_F(CallbackTest, ShortBodiesRefusedOrLoggedAsFarAsTheyGo) {
  // Refused when what is stored, relayed or chooses the path is missing; otherwise handled, with
  // one line first when what its lines show is missing (handled is then what they are).
  auto check = [&](int type, uint32_t service, int32_t msg_id, uint8_t txn, const Bytes& body,
                   unsigned needed, std::optional<std::vector<Logged>> handled = std::nullopt) {
    deliver(type, service, msg_id, txn, body);
    char line[128];
    snprintf(line, sizeof line,
             "rcv_test_msg: type %d service %u msg_id %d txn %u: body of %zu bytes, %s %u", type,
             service, msg_id, unsigned{txn}, body.size(), handled ? "its log lines need" : "needs",
             needed);
    std::vector<Logged> lines = handled.value_or(std::vector<Logged>{});
    if (body.size() < needed) lines.insert(lines.begin(), Logged{6, line});
    EXPECT_THAT(logged(), ElementsAreArray(lines));
  };
  check(1, 44, 32, 171, Bytes(139, 0), 140);
  check(1, 44, 32, 168, Bytes(27, 0), 28);
  check(1, 0, 11, 6, {}, 1);
  check(2, 0, 13, 0, resized(test_indication_body(0, 6, 0, 0, 0, {}), 51), 52);
  check(2, 0, 13, 0, resized(test_indication_body(10, 6, 0, 0, 0, {}), 67), 68);
  check(2, 0, 13, 0, resized(test_indication_body(20, 10, 5, 1, 3, {}), 83), 84);
  check(2, 0, 13, 0, resized(test_indication_body(30, 6, 0, 0, 0, {}), 27), 28);
  check(2, 0, 3, 0, resized(sample_indication_body(0, 0, 1, 2, 3), 23), 24);
  check(2, 44, 33, 0, resized(daf_indication_body(61, 1, 24, {}), 31), 32);
  check(2, 44, 33, 0, resized(daf_indication_body(51, 1, 8, {}), 15), 16);
  EXPECT_FALSE(kernel->next_frame(50ms)) << "nothing relayed";
  EXPECT_THAT(factory_state().mag_result, Each(0)) << "nothing stored";
  EXPECT_FALSE(command_waiter_arrived_for_testing()) << "the waiting command sees no response";

  Bytes states(194, 255);
  states[4 + 16 * 10] = 1;
  states[4 + 16 * 11] = 2;
  const Logged state10 = {4, "STATE: Type-  1 ffffffff ffff"};
  check(1, 0, 64, 0, resized(states, 193), 194, {{state10}});
  check(1, 0, 64, 0, states, 194, {{state10, {4, "STATE: Type-  2 ffffffff ffff"}}});
  check(1, 0, 2, 2, Bytes(8, 0), 9, {{}});
  const std::string passed = "rcv_test_msg: Registers Received test Passed1: 0, 1, 2";
  check(2, 0, 13, 0, resized(test_indication_body(30, 6, 0, 0, 0, {1, 2}), 28), 76,
        {{{4, "rcv_test_msg, SensorID:30, TestType:6"},
          {4, passed},
          {4, "rcv_complete: result - 0\n"}}});
  check(2, 0, 13, 0, resized(test_indication_body(0, 6, 0, 0, 0, count_from(1, 8)), 52), 76,
        {{{4, "rcv_test_msg, SensorID:0, TestType:6"},
          {4, passed + ", 3, 4, 5, 6, 7, 8"},
          {4, "rcv_complete: result - 0\n"}}});
  EXPECT_THAT(factory_state().pressure_result, ElementsAre(1, 2));
  EXPECT_THAT(factory_state().accel_result, ElementsAreArray(count_from(1, 8)));
  check(2, 0, 13, 0, resized(test_indication_body(50, 10, 5, 1, 3, {}), 13), 14,
        {{{4, "rcv_test_msg, SensorID:50, TestType:10"},
          {6, "rcv_test_msg: wrong SensorID 50"},
          {4, "rcv_complete: result - 1\n"}}});
}

}  // namespace
