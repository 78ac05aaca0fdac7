// SPDX-License-Identifier: Apache-2.0
// In-process fixture: the daemon's library with its kernel channel on a real netlink socket in
// this test's private network namespace, the kernel driver played by a KernelPort, the sensor
// processor by an in-process Simulator on the sensor1 socket, and every log record captured.
// The test's own thread plays the daemon's main thread.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <vector>

#include "kernel_port.h"
#include "log_capture.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

using kestrelctl::build_command;
using kestrelctl::build_frame;
using kestrelctl::Frame;
using kestrelctl::KernelPort;

class DaemonFixture : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  // Runs one datagram through process_message on this thread, as the receive loop does.
  void dispatch(const std::vector<uint8_t>& datagram);
  // One command frame with payload words.
  void command(uint16_t number, const std::vector<int32_t>& words = {});

  // The next kernel frame of a type, whole or its payload only (empty when none came).
  std::vector<uint8_t> frame(uint16_t type, bool payload_only = false) {
    std::optional<Frame> f = kernel->next_frame_of_type(type, std::chrono::seconds(5));
    EXPECT_TRUE(f) << "no frame of type " << type;
    return !f ? std::vector<uint8_t>{} : payload_only ? f->payload : f->raw;
  }
  // Messages logged under KESTRELD since SetUp (or the last log->clear()).
  std::vector<std::string> lines() const { return log->messages(); }

  std::unique_ptr<LogCapture> log;
  std::unique_ptr<KernelPort> kernel;
  std::unique_ptr<kestrel_sim::Simulator> sim;
  // Leave false for tests that deliberately leave bodies behind.
  bool check_bodies_released = true;
  long stale_calls_at_setup = 0;  // sensor1 calls on closed handles; none may be added
};

using std::chrono_literals::operator""ms;
