// The status requests, and the request pattern's failure paths driven through the sensor1
// stand-in's faults: allocation, write with a good or a failing close, and a write answered 11.
#include "requests/status_requests.h"
#include "request_test_support.h"
#include "service_link/connection.h"

namespace request_test {
namespace {

using kestrel_sim::FaultOp;
using ::testing::ElementsAre;

using StatusTest = RequestTest;

TEST_F(StatusTest, StatusReplyTellsWhetherATestIndicationWasHandedOver) {
  // The sensor manager answers the status request itself, which ends no wait.
  sim->set_request_hook([](Simulator& s, const Request& r) {
    s.respond(r.header, kestrel_sim::common_response_body(0, 0));
  });
  command(0, {3});
  const Request r = next();
  EXPECT_THAT(r, IsRequest(0, 11, 3, 6));
  EXPECT_EQ(r.body, Bytes({30, 0, 0}));
  EXPECT_EQ(frame(0), expected_frame(0, {3, 1}));
  EXPECT_THAT(main_lines(),
              ElementsAre("process_message: 0", "sensor1_open_or_reopen: sensor1_open success\n",
                          "get_handle_for_sensor: id:3\n", "waiting for response IN - timeout=8000",
                          "wait_for_response: pthread_cond_timedwait() rc=110",
                          "wait_for_response: response received.",
                          "get_status: ERROR: No response for command"));

  answer_tests(30, 3, {}, -1, 11);
  command(0, {3});
  EXPECT_EQ(frame(0), expected_frame(0, {3, 0}));

  // Out of the table: SensorID 0xFF, and the reply carries the low byte of the sensor_type.
  for (int32_t sensor_type : {16, -1}) {
    sim->clear_requests();
    command(0, {sensor_type});
    EXPECT_EQ(next().body, Bytes({0xff, 0, 0}));
    EXPECT_EQ(frame(0), expected_frame(0, {static_cast<uint8_t>(sensor_type), 0}));
  }
}

TEST_F(StatusTest, SensorStateRequestGoesOutWithTheLoggingCommand) {
  command(27, {0, 2});  // an action that changes nothing but still asks for the states
  const Request r = next();
  EXPECT_THAT(r, IsRequest(0, 64, 1, 0));
  EXPECT_EQ(r.body, Bytes({0xaa}));
  EXPECT_THAT(main_lines(),
              ElementsAre("process_message: 27", "sensor1_open_or_reopen: sensor1_open success\n",
                          "get_handle_for_sensor: id:0\n"));
}

class RequestPatternTest : public RequestTest {
 protected:
  void SetUp() override {
    RequestTest::SetUp();
    ASSERT_NE(get_handle_for_sensor(0), nullptr);
    log->clear();
  }
};

TEST_F(RequestPatternTest, AllocationFailureLogsTheOperationsTextAndSendsNothing) {
  struct Case {
    uint16_t command;
    std::vector<int32_t> words;
    const char* line;
  };
  const Case cases[] = {
      {0, {1}, "[get_status]sensor1_alloc_msg_buf error - -7\n"},
      {1, {4}, "get_raw error get_raw_data returned -7\n"},
      {3, {4}, "get_raw error get_raw_data returned -7\n"},
      {17, {}, "set_accel_motor sensor1_alloc_msg_buf error:-7\n"},
  };
  for (const Case& c : cases) {
    ASSERT_TRUE(sim->fault(FaultOp::kAlloc, -7, 1));
    log->clear();
    command(c.command, c.words);
    EXPECT_THAT(main_lines(), ElementsAre("process_message: " + std::to_string(c.command), c.line));
  }
  EXPECT_TRUE(no_frame());
  command(18);                       // the first request that reaches the sensor processor
  EXPECT_EQ(next().body[16], 0xac);  // 100012, motor disabled
  EXPECT_EQ(sim->requests().size(), 1u);
}

TEST_F(RequestPatternTest, WriteFailureClosesTheConnectionAndTheNextRequestOpensANewOne) {
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, -5, 1));
  command(0, {1});
  EXPECT_THAT(main_lines(),
              ElementsAre("process_message: 0", "[get_status]sensor1_write -error  -5\n"));
  EXPECT_TRUE(no_frame());
  EXPECT_TRUE(sim->wait_for_disconnect(2000ms));

  answer_tests(10, 3, {}, -1, 11);
  command(0, {1});
  EXPECT_EQ(sim->opened_connections(), 2);
  EXPECT_EQ(next().connection, 2);
  EXPECT_EQ(frame(0), expected_frame(0, {1, 0}));
}

TEST_F(RequestPatternTest, WriteAnsweredWouldBlockCountsAsSent) {
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 11, 1));
  answer_tests(10, 3, {}, -1, 11);
  command(0, {1});
  EXPECT_THAT(next(), IsRequest(0, 11, 3, 6));
  EXPECT_EQ(frame(0), expected_frame(0, {1, 0}));
}

// The process ends with the close's result. The child starts its own simulator and connection
// (the "threadsafe" style runs it in a fresh process), so it inherits no lock held by another
// thread at the moment of the fork.
TEST(RequestPatternDeathTest, FailingCloseEndsTheProcessWithItsResult) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const Bytes frame = command_frame(0, {1});
  EXPECT_EXIT(
      {
        Simulator simulator(test_socket_path());
        get_handle_for_sensor(0);
        simulator.fault(FaultOp::kWrite, -5, 1);
        simulator.fault(FaultOp::kClose, 9, 1);
        get_status(frame.data());
      },
      ::testing::ExitedWithCode(9),
      "get_status\\]sensor1_write -error  -5\n(.|\n)*sensor1_close returned 9\n");
}

}  // namespace
}  // namespace request_test
