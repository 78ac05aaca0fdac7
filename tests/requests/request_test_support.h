// Shared pieces of the request tests: the fixture with the sensor processor answering test
// requests on demand, byte builders and the daemon's own lines without the callback's.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <vector>

#include "daemon_fixture.h"

namespace request_test {

using kestrel_sim::Header;
using kestrel_sim::Request;
using kestrel_sim::Simulator;
using Bytes = std::vector<uint8_t>;

inline void put32(Bytes& b, size_t offset, uint32_t v) {
  memcpy(b.data() + offset, &v, 4);
}
inline void put16(Bytes& b, size_t offset, uint16_t v) {
  memcpy(b.data() + offset, &v, 2);
}

// Little-endian 32-bit words.
inline Bytes words(const std::vector<int32_t>& w) {
  Bytes b(w.size() * 4);
  if (!w.empty()) memcpy(b.data(), w.data(), b.size());
  return b;
}

// A single-sensor test request body.
inline Bytes test_request(uint8_t sensor_id, uint32_t test_type, uint8_t o0, uint8_t o1) {
  Bytes b(12, 0);
  b[0] = sensor_id;
  put32(b, 4, test_type);
  b[8] = o0;
  b[9] = o1;
  return b;
}

// A daf_request body with a SUID (all zero when null), request id and data.
inline Bytes daf_request(const uint8_t* suid, uint32_t request_id, const Bytes& data,
                         bool with_length = true) {
  Bytes b(288, 0);
  if (suid != nullptr) memcpy(b.data(), suid, 16);
  put32(b, 16, request_id);
  b[20] = 1;
  if (with_length) put32(b, 24, static_cast<uint32_t>(data.size()));
  if (!data.empty()) memcpy(b.data() + 28, data.data(), data.size());
  return b;
}

inline const uint8_t kLightSuid[16] = {0x33, 0xfc, 0x91, 0xdc, 0xc8, 0x0c, 0x41, 0xf2,
                                       0xa3, 0xf2, 0xce, 0xd5, 0xe2, 0x9e, 0xb7, 0x8b};
inline const uint8_t kAccelSuid[16] = {0x3c, 0xfd, 0x26, 0xe8, 0x52, 0xaf, 0x48, 0xbe,
                                       0xac, 0xc2, 0x1d, 0x40, 0xfc, 0x4c, 0x53, 0x68};
inline const uint8_t kMagSuid[16] = {0xf6, 0xae, 0x80, 0xfe, 0x94, 0x2b, 0x4d, 0x56,
                                     0x8f, 0x16, 0x61, 0xd5, 0x98, 0x1b, 0x61, 0x90};

MATCHER_P4(IsRequest, service, msg_id, size, txn_id, "") {
  return arg.header.service == static_cast<uint32_t>(service) && arg.header.msg_id == msg_id &&
         arg.header.msg_size == size && arg.header.txn_id == txn_id &&
         arg.body.size() == static_cast<size_t>(size);
}

class RequestTest : public DaemonFixture {
 protected:
  // The lines of the daemon's main thread. The callback's own lines are dropped, and so is the
  // wait's note that the answer came before it took its lock: an answer given the moment the
  // request arrives may land on either side of that instant.
  std::vector<std::string> main_lines() const {
    std::vector<std::string> out;
    for (const std::string& m : lines()) {
      if (m.rfind("rcv_test_msg", 0) == 0 || m.rfind("rcv_complete", 0) == 0 ||
          m.rfind("SNS_SMGR_", 0) == 0 || m.rfind("STATE:", 0) == 0 ||
          m == "wait_for_response: cb has arrived without waiting") {
        continue;
      }
      out.push_back(m);
    }
    return out;
  }

  // Answers every sensor-manager request msg_id (the single-sensor test request unless named)
  // with a passed test indication of sensor_id carrying the words (status 0), or a failed one
  // with an error code when error_code is not negative.
  void answer_tests(uint8_t sensor_id, int32_t test_type, std::vector<int32_t> w,
                    int error_code = -1, int32_t msg_id = 13) {
    sim->set_request_hook([=](Simulator& s, const Request& r) {
      if (r.header.service != 0 || r.header.msg_id != msg_id) return;
      const bool failed = error_code >= 0;
      s.indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(
                                          sensor_id, test_type, failed ? 5 : 0, failed ? 1 : 0,
                                          static_cast<uint8_t>(failed ? error_code : 0), w));
    });
  }

  Request next() {
    std::optional<Request> r = sim->next_request(2000ms);
    EXPECT_TRUE(r.has_value()) << "no request reached the sensor processor";
    return r.value_or(Request{});
  }

  // The next kernel frame of a type, as its whole raw bytes (empty when none came).
  Bytes frame(uint16_t type) {
    std::optional<KernelFrame> f = kernel->receive_type(type, 2000ms);
    return f ? f->raw : Bytes{};
  }

  // Raw bytes of an outbound frame of type with payload (alignment included in nlmsg_len).
  static Bytes expected_frame(uint16_t type, const Bytes& payload) {
    const uint32_t len = (static_cast<uint32_t>(payload.size()) + 19) & ~3u;
    Bytes f(len, 0);
    put32(f, 0, len);
    put16(f, 4, type);
    put32(f, 12, 20000);
    memcpy(f.data() + 16, payload.data(), payload.size());
    return f;
  }

  // The frame of type whose payload is the words w, padded with zero words to n.
  static Bytes word_frame(uint16_t type, std::vector<int32_t> w, size_t n) {
    w.resize(n, 0);
    return expected_frame(type, words(w));
  }

  // The last n lines logged (all of them when fewer).
  std::vector<std::string> last_lines(size_t n) const {
    std::vector<std::string> all = lines();
    if (all.size() > n) all.erase(all.begin(), all.end() - static_cast<long>(n));
    return all;
  }

  // True when no kernel frame at all arrives within a short quiet time.
  bool no_frame() { return kernel->drain(100ms).empty(); }
};

}  // namespace request_test
