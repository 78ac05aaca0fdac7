// Command 6 against the simulated sensor manager: the single-sensor test request byte for byte,
// the completion that the sensor manager sends back (or does not), the type-7 reply, and the
// write failures of the closing variant, down to the exit of the process.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <vector>

#include "daemon_fixture.h"
#include "service_link/factory_state.h"

using kestrel_sim::FaultOp;
using kestrel_sim::Header;
using kestrel_sim::Request;
using kestrel_sim::Simulator;
using ::testing::Contains;
using ::testing::ElementsAre;
using ::testing::Not;

// A forked child ends holding memory of threads that exist only in the parent; LeakSanitizer
// reports that at the child's exit and replaces its exit status.
#if defined(__SANITIZE_ADDRESS__)
#define KESTREL_LEAK_CHECKED_EXIT 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(leak_sanitizer)
#define KESTREL_LEAK_CHECKED_EXIT 1
#endif
#endif

namespace {

std::vector<uint8_t> test_request(uint8_t sensor_id, uint32_t test_type) {
  std::vector<uint8_t> b = {sensor_id, 0, 0, 0, 0, 0, 0, 0, 1, 1, 1, 1};
  memcpy(b.data() + 4, &test_type, 4);
  return b;
}

std::vector<uint8_t> reply(int32_t pdata, int32_t result) {
  std::vector<uint8_t> b(8);
  memcpy(b.data(), &pdata, 4);
  memcpy(b.data() + 4, &result, 4);
  return b;
}

class CalibrationStoreTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    // The sensor manager completes each calibration as soon as it is asked, while complete is on.
    sim->set_request_hook([this](Simulator& s, const Request& r) {
      if (!complete || r.header.msg_id != 13 || r.body.size() < 8) return;
      int32_t test_type;
      memcpy(&test_type, r.body.data() + 4, 4);
      s.indicate(Header{0, 13, 0, 4},
                 kestrel_sim::test_indication_body(r.body[0], test_type, 0, 0, 0, {}));
    });
  }

  void TearDown() override {
    if (sim) sim->set_request_hook(nullptr);
    DaemonFixture::TearDown();
  }

  // Runs command 6; returns the request and the reply payload.
  std::pair<Request, std::vector<uint8_t>> store(int32_t sensor_type, int32_t flag) {
    log->clear();
    command(6, {sensor_type, flag});
    const auto request = sim->next_request(2000ms);
    EXPECT_TRUE(request.has_value());
    const auto frame = kernel->receive_type(7, 4000ms);
    EXPECT_TRUE(frame.has_value());
    if (frame) {
      EXPECT_EQ(frame->len, 24u);
    }
    return {request.value_or(Request{}), frame ? frame->payload : std::vector<uint8_t>{}};
  }

  // This command's own lines.
  std::vector<std::string> own_lines() const {
    std::vector<std::string> out;
    for (const std::string& m : lines()) {
      if (m.rfind("store_calib_data", 0) == 0 || m.rfind("[store_calib_data]", 0) == 0) {
        out.push_back(m);
      }
    }
    return out;
  }

  std::atomic<bool> complete{true};
};

TEST_F(CalibrationStoreTest, FlagChoosesTheTestTypeForAccelerometerAndLight) {
  struct {
    int32_t sensor_type, flag;
    uint8_t id;
    uint32_t test_type;
    int32_t pdata;
  } cases[] = {{0, 0, 0, 8, 0},  {0, 1, 0, 7, 0},   {4, 0, 40, 8, 5},
               {4, 1, 40, 7, 5}, {5, -9, 40, 7, 5}, {12, 0, 0, 8, 0}};
  for (const auto& c : cases) {
    SCOPED_TRACE(std::to_string(c.sensor_type) + " flag " + std::to_string(c.flag));
    const auto [request, payload] = store(c.sensor_type, c.flag);
    EXPECT_EQ(request.header.service, 0u);
    EXPECT_EQ(request.header.msg_id, 13);
    EXPECT_EQ(request.header.msg_size, 12);
    EXPECT_EQ(request.header.txn_id, 4);
    EXPECT_EQ(request.body, test_request(c.id, c.test_type));
    EXPECT_EQ(payload, reply(c.pdata, 0));
    EXPECT_THAT(
        own_lines(),
        ElementsAre("store_calib_data: Enter\n",
                    "store_calib_data: sensor_type = " + std::to_string(c.sensor_type) + " \n",
                    "store_calib_data: CAL(" + std::to_string(c.flag) + ")",
                    "store_calib_data: SensorID:" + std::to_string(c.id) + ", DataType:0"));
  }
  const std::vector<LogRecord> records = log->records();
  for (const LogRecord& r : records) {
    if (r.message.rfind("store_calib_data: sensor_type", 0) == 0) {
      EXPECT_EQ(r.priority, 6);
    }
    if (r.message.rfind("store_calib_data: CAL", 0) == 0) {
      EXPECT_EQ(r.priority, 4);
    }
  }
}

TEST_F(CalibrationStoreTest, OtherSensorsUseAFixedTestTypeAndIgnoreTheFlag) {
  struct {
    int32_t sensor_type;
    uint8_t id;
    uint32_t test_type;
    int32_t pdata;
  } cases[] = {{2, 20, 0, 2},   {1, 10, 3, 1},    {3, 30, 3, 3},   {6, 60, 3, 6},
               {7, 255, 3, -1}, {16, 255, 3, -1}, {-1, 255, 3, -1}};
  for (const auto& c : cases) {
    SCOPED_TRACE(c.sensor_type);
    const auto [request, payload] = store(c.sensor_type, 1);
    EXPECT_EQ(request.body, test_request(c.id, c.test_type));
    EXPECT_EQ(payload, reply(c.pdata, 0));
    EXPECT_THAT(
        own_lines(),
        ElementsAre("store_calib_data: Enter\n",
                    "store_calib_data: sensor_type = " + std::to_string(c.sensor_type) + " \n",
                    "store_calib_data: SensorID:" + std::to_string(c.id) + ", DataType:0"));
  }
}

TEST_F(CalibrationStoreTest, CompletionBeforeTheWaitAndNoCompletionAtAll) {
  store(1, 0);  // opens the connection
  complete = false;

  // A completion that lands before the command waits is taken at once.
  log->clear();
  sim->indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(0, 8, 0, 0, 0, {}));
  ASSERT_TRUE(log->wait_for("rcv_complete: result - 0\n", 2000ms));
  auto early = store(0, 0);
  EXPECT_EQ(early.first.body, test_request(0, 8));
  EXPECT_EQ(early.second, reply(0, 0));
  EXPECT_THAT(lines(), Contains("wait_for_response: cb has arrived without waiting"));

  // None at all: the wait runs out and the reply says so; test_status has no outcome.
  auto none = store(2, 0);
  EXPECT_EQ(none.first.body, test_request(20, 0));
  EXPECT_EQ(none.second, reply(2, 1));
  EXPECT_THAT(lines(), Contains("store_calib_data: ERROR: No response for command"));
  EXPECT_EQ(test_status(), -1);
}

TEST_F(CalibrationStoreTest, FailedWriteClosesTheConnectionAndSendsNoReply) {
  store(0, 0);  // the connection is open
  log->clear();
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  command(6, {4, 1});
  EXPECT_THAT(own_lines(),
              ElementsAre("store_calib_data: Enter\n", "store_calib_data: sensor_type = 4 \n",
                          "store_calib_data: CAL(1)", "store_calib_data: SensorID:40, DataType:0",
                          "[store_calib_data]sensor1_write -error  5\n"));
  EXPECT_THAT(lines(), Not(Contains("waiting for response IN - timeout=8000")));
  ASSERT_TRUE(sim->wait_for_disconnect(2000ms));

  // The next command opens a new connection, and its reply is the first frame to come.
  command(6, {2, 0});
  const auto request = sim->next_request(2000ms);
  ASSERT_TRUE(request.has_value());
  EXPECT_EQ(request->connection, 2);
  const auto frame = kernel->receive(4000ms);
  ASSERT_TRUE(frame.has_value());
  EXPECT_EQ(frame->type, 7);
  EXPECT_EQ(frame->payload, reply(2, 0));
}

TEST_F(CalibrationStoreTest, FailedCloseAfterAFailedWriteEndsTheProcess) {
#ifdef KESTREL_LEAK_CHECKED_EXIT
  GTEST_SKIP() << "exit status of a forked child is not kept under LeakSanitizer";
#endif
  store(0, 0);
  ASSERT_TRUE(sim->fault(FaultOp::kWrite, 5, 1));
  ASSERT_TRUE(sim->fault(FaultOp::kClose, 9, 1));
  EXPECT_EXIT(command(6, {0, 0}), ::testing::ExitedWithCode(9),
              "");  // the log goes to the capture, not to stderr

  // The child's close ended the connection this process shares with it, so the service callback
  // here rebuilds the link. Let it finish before the fixture is torn down (no assertions: that
  // recovery is not what this test is about).
  log->wait_for("rcv_test_msg hh_read_data_thread success\n", 5000ms);
  kernel->receive_type(34, 5000ms);
}

}  // namespace
