// SPDX-License-Identifier: Apache-2.0
// The fixture of the tests that drive the daemon's sensor1 requests against the in-process sensor
// processor: request bodies and kernel frames built byte by byte, test indications sent on
// demand, and the daemon's own lines without the service callback's.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "daemon_fixture.h"
#include "daemon_frames.h"
#include "service_link/connection.h"

namespace kestrel_sim {
inline void PrintTo(const Request& r, std::ostream* os) {
  *os << "service " << r.header.service << " msg_id " << r.header.msg_id << " size "
      << r.header.msg_size << " txn " << int{r.header.txn_id} << " body "
      << ::testing::PrintToString(r.body);
}
}  // namespace kestrel_sim

namespace request_test {

using kestrel_sim::FaultOp;
using kestrel_sim::Header;
using kestrel_sim::Request;
using kestrel_sim::Simulator;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;

template <typename T>
void put(Bytes& b, size_t offset, T v) {
  memcpy(b.data() + offset, &v, sizeof v);
}

// A single-sensor test request body: SensorID, TestType and the four option bytes.
inline Bytes test_request(uint8_t sensor_id, uint32_t test_type, uint8_t o0, uint8_t o1,
                          uint8_t o2 = 0, uint8_t o3 = 0) {
  Bytes b = {sensor_id, 0, 0, 0, 0, 0, 0, 0, o0, o1, o2, o3};
  put(b, 4, test_type);
  return b;
}

inline const Bytes kLightSuid = {0x33, 0xfc, 0x91, 0xdc, 0xc8, 0x0c, 0x41, 0xf2,
                                 0xa3, 0xf2, 0xce, 0xd5, 0xe2, 0x9e, 0xb7, 0x8b};
inline const Bytes kAccelSuid = {0x3c, 0xfd, 0x26, 0xe8, 0x52, 0xaf, 0x48, 0xbe,
                                 0xac, 0xc2, 0x1d, 0x40, 0xfc, 0x4c, 0x53, 0x68};
inline const Bytes kPressureSuid = {0x40, 0x50, 0xf5, 0x06, 0x32, 0x95, 0x11, 0xe6,
                                    0x8e, 0x99, 0x40, 0xa8, 0xf0, 0x5f, 0x17, 0xff};
inline const Bytes kMagSuid = {0xf6, 0xae, 0x80, 0xfe, 0x94, 0x2b, 0x4d, 0x56,
                               0x8f, 0x16, 0x61, 0xd5, 0x98, 0x1b, 0x61, 0x90};

// A daf_request body (288 bytes): SUID, request id, flag 1, data length and data.
inline Bytes daf_request(const Bytes& suid, uint32_t request_id, const Bytes& data) {
  Bytes b(288, 0);
  std::copy(suid.begin(), suid.end(), b.begin());
  put(b, 16, request_id);
  b[20] = 1;
  put(b, 24, static_cast<uint32_t>(data.size()));
  std::copy(data.begin(), data.end(), b.begin() + 28);
  return b;
}

// A request with its header and its whole body.
MATCHER_P4(IsRequest, service, msg_id, txn_id, body, "") {
  return arg.header.service == static_cast<uint32_t>(service) && arg.header.msg_id == msg_id &&
         arg.header.msg_size == body.size() && arg.header.txn_id == txn_id && arg.body == body;
}

// Expects op, run where the next write fails with 5 and the close after it with 9, to end the
// process with the close's result once name has logged the failed write. The child starts its
// own simulator and connection (the "threadsafe" style runs it in a fresh process), so it
// inherits no lock held by another thread at the moment of the fork.
inline void expect_exit_on_failing_close(const std::function<void()>& op, const std::string& name) {
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_EXIT(
      {
        Simulator simulator(test_socket_path());
        get_handle_for_sensor(0);
        simulator.fault(FaultOp::kWrite, 5, 1);
        simulator.fault(FaultOp::kClose, 9, 1);
        op();
      },
      ::testing::ExitedWithCode(9),
      name + "\\]sensor1_write -error  5\n(.|\n)*sensor1_close returned 9\n");
}

class RequestTest : public DaemonFixture {
 protected:
  // The lines of the daemon's main thread. The callback's own lines are dropped, and so is the
  // wait's note that the answer came before it took its lock: an answer given the moment the
  // request arrives may land on either side of that instant.
  Lines main_lines() const {
    Lines out;
    for (const std::string& m : lines()) {
      if (m.rfind("rcv_test_msg", 0) != 0 && m.rfind("rcv_complete", 0) != 0 &&
          m.rfind("SNS_SMGR_", 0) != 0 && m.rfind("STATE:", 0) != 0 &&
          m != "wait_for_response: cb has arrived without waiting") {
        out.push_back(m);
      }
    }
    return out;
  }

  // The last n lines logged (all of them when fewer).
  Lines last_lines(size_t n) const {
    Lines all = lines();
    return Lines(all.end() - static_cast<long>(std::min(n, all.size())), all.end());
  }

  // Answers every sensor-manager request msg_id (the single-sensor test request unless named)
  // with a test indication carrying the words w: passed, or failed with error_code when that is
  // not negative. A negative sensor_id or test_type takes the request's own.
  void answer_tests(int sensor_id = -1, int32_t test_type = -1, std::vector<int32_t> w = {},
                    int error_code = -1, int32_t msg_id = 13) {
    sim->set_request_hook([=](Simulator& s, const Request& r) {
      if (r.header.service != 0 || r.header.msg_id != msg_id) return;
      const bool failed = error_code >= 0;
      s.indicate(Header{0, 13, 0, 4},
                 kestrel_sim::test_indication_body(
                     static_cast<uint8_t>(sensor_id < 0 ? r.body.at(0) : sensor_id),
                     test_type < 0 ? r.body.at(4) : test_type, failed ? 5 : 0, failed ? 1 : 0,
                     static_cast<uint8_t>(failed ? error_code : 0), w));
    });
  }

  Request next() {
    std::optional<Request> r = sim->next_request(2000ms);
    EXPECT_TRUE(r.has_value()) << "no request reached the sensor processor";
    return r.value_or(Request{});
  }

  // True when no kernel frame at all arrives within a short quiet time.
  bool no_frame() { return kernel->drain(100ms).empty(); }
};

}  // namespace request_test
