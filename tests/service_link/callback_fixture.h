// SPDX-License-Identifier: Apache-2.0
// The service callback reached as the library reaches it, from any of the test's threads, with
// the daemon's records and frames at hand, on the DIAG tests' fixture (recording shell tools first
// on PATH, no properties).
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <utility>
#include <vector>

#include "daemon_frames.h"
#include "sensor1_host.h"
#include "service_link/connection.h"
#include "service_link/service_callback.h"
#include "tests/diag/diag_fixture.h"

using Logged = std::pair<int, std::string>;  // priority, message

class CallbackTest : public DiagTest {
 protected:
  // A body from the library's allocator whose size is the header's msg_size; empty means null.
  static void deliver(int type, uint32_t service, int32_t msg_id, uint8_t txn, const Bytes& body) {
    sensor1_msg_header_s hdr = {service, msg_id, static_cast<uint16_t>(body.size()), txn};
    void* msg = body.empty() ? nullptr : sensor1_host_alloc_body(body.size());
    if (msg != nullptr) memcpy(msg, body.data(), body.size());
    rcv_test_msg(sensor1_callback_data(), &hdr, type, msg);
  }
  // The daemon's records since the last clear, which this clears.
  std::vector<Logged> logged() const {
    std::vector<Logged> out;
    for (const LogRecord& r : log->records()) {
      if (r.tag == "KESTRELD") out.emplace_back(r.priority, r.message);
    }
    log->clear();
    return out;
  }
};
