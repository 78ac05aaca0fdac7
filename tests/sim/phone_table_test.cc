// SPDX-License-Identifier: Apache-2.0
// The phone's table of requests: what each kind of request says in the trace, and which requests
// break the rules of what the daemon may write (size, transaction id, fixed bytes).
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tools/sim/healthy_phone.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_sim::Header;
using kestrel_sim::Request;
using Bytes = std::vector<uint8_t>;

Bytes with(size_t size, std::vector<std::pair<size_t, uint8_t>> bytes) {
  Bytes b(size, 0);
  for (const auto& [offset, value] : bytes) b[offset] = value;
  return b;
}

// A daf_request; too_long: data_length 257, one byte more than the data can hold.
Bytes daf(uint32_t id, uint8_t flag, uint8_t trailing, bool too_long) {
  return with(288, {{16, id & 0xff},
                    {17, (id >> 8) & 0xff},
                    {18, id >> 16},
                    {20, flag},
                    {24, too_long},
                    {25, too_long},
                    {284, trailing}});
}

struct Case {
  Header header;  // msg_size 0: the body's size
  Bytes body;
  std::string line;
  bool breaks_rules;
};

TEST(PhoneTableTest, DescribesEachKindAndChecksItsRules) {
  const Case cases[] = {
      {{0, 11, 0, 6}, {20, 0, 0}, "svc 0 msg 11 txn 6 size 3: status SensorID 20", false},
      {{0, 11, 0, 7}, {20, 0, 0}, "svc 0 msg 11 txn 7 size 3: status SensorID 20", true},
      {{0, 11, 2, 6}, {20, 0, 0}, "svc 0 msg 11 txn 6 size 3: status SensorID 20", true},
      {{0, 13, 0, 4},
       with(12, {{4, 3}, {8, 1}, {9, 1}, {10, 1}, {11, 1}}),
       "svc 0 msg 13 txn 4 size 12: calibration SensorID 0 TestType 3",
       false},
      {{0, 13, 0, 4},
       with(12, {{0, 10}, {1, 1}, {4, 13}}),
       "svc 0 msg 13 txn 4 size 12: temperature SensorID 10 TestType 13",
       true},
      {{0, 38, 0, 4},
       {0, 20, 0},
       "svc 0 msg 38 txn 4 size 3: calibration reset SensorID 20",
       false},
      {{0, 64, 0, 0}, {0xAB}, "svc 0 msg 64 txn 0 size 1: sensor states", true},
      {{0, 2, 0, 2},
       with(272, {{0, 25}, {1, 1}, {2, 50}, {12, 20}}),
       "svc 0 msg 2 txn 2 size 272: report 25 start SensorID 20 at 50 Hz",
       false},
      {{0, 2, 0, 2},
       with(271, {{0, 5}, {1, 2}}),
       "svc 0 msg 2 txn 2 size 271: report 5 stop",
       true},
      {{44, 32, 0, 171},
       daf(100015, 1, 0, false),
       "svc 44 msg 32 txn 171 size 288: register dump (daf 100015)",
       false},
      {{44, 32, 0, 123},
       daf(100007, 1, 1, false),
       "svc 44 msg 32 txn 123 size 288: thresholds (daf 100007)",
       true},
      {{44, 32, 0, 123},
       daf(100003, 1, 0, true),
       "svc 44 msg 32 txn 123 size 288: bulk data (daf 100003)",
       true},
      {{44, 32, 0, 9},
       daf(7, 1, 0, false),
       "svc 44 msg 32 txn 9 size 288: driver request (daf 7)",
       true},
      {{13, 5, 0, 1}, {1, 2, 3}, "svc 13 msg 5 txn 1 size 3: unknown request", true},
  };
  kestrel_sim::Simulator sim(kestrel_sim::Simulator::InProcess{});
  std::vector<std::string> reported;
  sim.phone().set_bad_request_hook([&](const std::string& line) { reported.push_back(line); });
  for (const Case& c : cases) {
    Request req{0, c.header, c.body};
    if (req.header.msg_size == 0) req.header.msg_size = static_cast<uint16_t>(c.body.size());
    SCOPED_TRACE(c.line);
    EXPECT_EQ(kestrel_sim::describe_request(req), c.line);
    reported.clear();
    sim.phone().answer(req);  // no connection 0: nothing is sent
    EXPECT_EQ(reported, c.breaks_rules
                            ? std::vector<std::string>{"request breaks the rules: " + c.line}
                            : std::vector<std::string>{});
  }
}

}  // namespace
