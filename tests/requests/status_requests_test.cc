// The status requests, and the request pattern's failure paths driven through the sensor1
// stand-in's faults: allocation, write with a good or a failing close, and a write answered 11.
#include "requests/status_requests.h"
#include "request_fixture.h"

namespace request_test {
namespace {

using StatusTest = RequestTest;

TEST_F(StatusTest, StatusReplyTellsWhetherATestIndicationWasHandedOver) {
  // The sensor manager answers the status request itself, which ends no wait.
  sim->set_request_hook([](Simulator& s, const Request& r) {
    s.respond(r.header, kestrel_sim::common_response_body(0, 0));
  });
  command(0, {3});
  EXPECT_THAT(next(), IsRequest(0, 11, 6, Bytes({30, 0, 0})));
  EXPECT_EQ(frame(0), expected_frame(0, {3, 1}));
  EXPECT_THAT(last_lines(2), ElementsAre("wait_for_response: response received.",
                                         "get_status: ERROR: No response for command"));

  // With an indication: {st, 0}. Out of the table: SensorID 0xFF, and the reply carries the low
  // byte of the sensor_type.
  answer_tests(30, 3, {}, -1, 11);
  for (const auto& [sensor_type, id] :
       {std::pair{3, 30}, std::pair{16, 0xff}, std::pair{-1, 0xff}}) {
    command(0, {sensor_type});
    EXPECT_EQ(next().body, Bytes({static_cast<uint8_t>(id), 0, 0}));
    EXPECT_EQ(frame(0), expected_frame(0, {static_cast<uint8_t>(sensor_type), 0}));
  }

  // The logging command asks for the sensor states, even with an action that changes nothing.
  log->clear();
  command(27, {0, 2});
  EXPECT_THAT(next(), IsRequest(0, 64, 0, Bytes({0xaa})));
  EXPECT_THAT(main_lines(), ElementsAre("process_message: 27"));
}

using RequestPatternTest = RequestTest;

TEST_F(RequestPatternTest, AllocationFailureLogsTheOperationsTextAndSendsNothing) {
  ASSERT_NE(get_handle_for_sensor(0), nullptr);
  const std::tuple<uint16_t, std::vector<int32_t>, const char*> cases[] = {
      {0, {1}, "[get_status]sensor1_alloc_msg_buf error - -7\n"},
      {1, {4}, "get_raw error get_raw_data returned -7\n"},
      {3, {4}, "get_raw error get_raw_data returned -7\n"},
      {17, {}, "set_accel_motor sensor1_alloc_msg_buf error:-7\n"},
  };
  for (const auto& [number, words, line] : cases) {
    ASSERT_TRUE(sim->fault(FaultOp::kAlloc, -7, 1));
    log->clear();
    command(number, words);
    EXPECT_THAT(main_lines(), ElementsAre("process_message: " + std::to_string(number), line));
  }
  EXPECT_TRUE(no_frame());
  command(18);                       // the first request that reaches the sensor processor
  EXPECT_EQ(next().body[16], 0xac);  // 100012, motor disabled
  EXPECT_EQ(sim->requests().size(), 1u);
}

TEST_F(RequestPatternTest, WriteFailureClosesTheConnectionAndTheNextRequestOpensANewOne) {
  ASSERT_NE(get_handle_for_sensor(0), nullptr);
  log->clear();
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, -5, 1));
  command(0, {1});
  EXPECT_THAT(main_lines(),
              ElementsAre("process_message: 0", "[get_status]sensor1_write -error  -5\n"));
  EXPECT_TRUE(no_frame());
  EXPECT_TRUE(sim->wait_for_disconnect(2000ms));

  // The next request opens a new connection; a write answered 11 counts as sent.
  answer_tests(10, 3, {}, -1, 11);
  command(0, {1});
  EXPECT_EQ(sim->opened_connections(), 2);
  EXPECT_EQ(next().connection, 2);
  EXPECT_EQ(frame(0), expected_frame(0, {1, 0}));
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 11, 1));
  command(0, {1});
  EXPECT_THAT(next(), IsRequest(0, 11, 6, Bytes({10, 0, 0})));
  EXPECT_EQ(frame(0), expected_frame(0, {1, 0}));
}

TEST(RequestPatternDeathTest, FailingCloseEndsTheProcessWithItsResult) {
  const Bytes frame = build_command(0, {1});
  expect_exit_on_failing_close([&] { get_status(frame.data()); }, "get_status");
}

}  // namespace
}  // namespace request_test
