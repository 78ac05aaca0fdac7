// SPDX-License-Identifier: Apache-2.0
// The status request and its reply, and the sensor-state request of command 27.
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
  EXPECT_EQ(frame(0), daemon_frame(0, {3, 1}));
  EXPECT_THAT(last_lines(2), ElementsAre("wait_for_response: response received.",
                                         "get_status: ERROR: No response for command"));

  // With an indication: {st, 0}. Out of the table: SensorID 0xFF, and the reply carries the low
  // byte of the sensor_type.
  answer_tests(30, 3, {}, -1, 11);
  for (const auto& [sensor_type, id] : {std::pair{3, 30}, {15, 0}, {16, 0xff}, {-1, 0xff}}) {
    command(0, {sensor_type});
    EXPECT_EQ(next().body, Bytes({static_cast<uint8_t>(id), 0, 0}));
    EXPECT_EQ(frame(0), daemon_frame(0, {static_cast<uint8_t>(sensor_type), 0}));
  }

  // The logging command asks for the sensor states, even with an action that changes nothing.
  log->clear();
  command(27, {0, 2});
  EXPECT_THAT(next(), IsRequest(0, 64, 0, Bytes({0xaa})));
  EXPECT_THAT(main_lines(), ElementsAre("process_message: 27"));
}

}  // namespace
}  // namespace request_test
