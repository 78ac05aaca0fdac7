// Start-up of the daemon as a process: its lines in order, the single-instance guard, the
// start-up failures and their exit statuses, and the coefficient refresh ten seconds later.
#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>

#include "daemon_process.h"
#include "kernel_port.h"

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;
using namespace std::chrono_literals;

namespace {

// The main thread's lines, in order; the start-up threads log beside them.
const std::vector<std::pair<int, std::string>> kMainLines = {
    {6, "Factory Daemon Start!"},
    {6, "Factory Daemon Start! 2"},
    {6, "Factory Daemon Start! 3"},
    {6, "Factory Daemon Start! 4"},
    {4, "main\n"},
    {4, "open_and_bind_socket: while 1 starting\n"},
    {4, "main SNS_DIAG_ENABLE_LOGGING enable\n"},
    {4, "main pthread_create success\n"},
    {4, "main read/update light coef efs file\n"},
    {4, "main hh_read_data_thread success\n"},
    {4, "main: do while start = 0\n"},
};

std::vector<std::pair<int, std::string>> main_lines(const DaemonProcess& d) {
  std::vector<std::pair<int, std::string>> out;
  for (const LogRecord& r : d.records()) {
    if (r.tag != "KESTRELD") continue;
    const bool known = std::any_of(kMainLines.begin(), kMainLines.end(),
                                   [&](const auto& l) { return l.second == r.message; });
    if (known) out.emplace_back(r.priority, r.message);
  }
  return out;
}

int hold_guard_port() {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  struct sockaddr_in addr;
  memset(&addr, 0, sizeof addr);
  addr.sin_family = AF_INET;
  addr.sin_port = htons(59234);
  addr.sin_addr.s_addr = htonl(INADDR_ANY);
  if (bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

TEST(StartupTest, LogsItsStartInOrderAndEntersTheReceiveLoop) {
  kestrelctl::KernelPort kernel;
  ASSERT_TRUE(kernel.open_bound(100));
  const auto started = std::chrono::steady_clock::now();
  DaemonProcess daemon;
  ASSERT_TRUE(daemon.wait_for("main: do while start = 0\n", 10s)) << daemon.output();
  EXPECT_GE(std::chrono::steady_clock::now() - started, scaled(5000ms)) << "the 5 s start delay";
  EXPECT_THAT(main_lines(daemon), ElementsAreArray(kMainLines));
  EXPECT_TRUE(daemon.wait_for("hh_read_data_thread start\n", 5s));
  EXPECT_FALSE(daemon.wait_exit(0ms)) << "the daemon keeps running";
}

TEST(StartupTest, SecondInstanceIsRefusedWhileTheGuardPortIsHeld) {
  const int held = hold_guard_port();
  ASSERT_GE(held, 0);
  // Were sensor1_init reached, this would end the process with 6 instead of 1.
  DaemonProcess daemon(DaemonEnv{{"KESTREL_SENSOR1_INIT_RESULT", "5"}});
  EXPECT_EQ(daemon.wait_exit(10s), 1);
  EXPECT_THAT(daemon.messages(),
              ElementsAre("Factory Daemon Start!",
                          "Program is already running... can't run second instance!!!"));
  close(held);
}

TEST(StartupTest, ARunningDaemonHoldsTheGuardSoASecondOneEndsWithStatusOne) {
  DaemonProcess first;
  ASSERT_TRUE(first.wait_for("main: do while start = 0\n", 10s)) << first.output();
  DaemonProcess second;
  EXPECT_EQ(second.wait_exit(10s), 1);
  EXPECT_EQ(second.count("Program is already running... can't run second instance!!!"), 1u);
  EXPECT_FALSE(first.wait_exit(0ms));
}

TEST(StartupTest, Sensor1InitFailureEndsWithStatusSix) {
  DaemonProcess daemon(DaemonEnv{{"KESTREL_SENSOR1_INIT_RESULT", "5"}});
  EXPECT_EQ(daemon.wait_exit(10s), 6);
  EXPECT_THAT(daemon.messages(),
              ElementsAre("Factory Daemon Start!", "Exiting! sensor1_init failed with 5"));
}

TEST(StartupTest, HeldNetlinkPortEndsMainWithStatusZeroAndNoThread) {
  // Another socket already holds the daemon's port id 20000.
  kestrelctl::KernelPort squatter;
  ASSERT_TRUE(squatter.open_bound(20000));
  DaemonProcess daemon;
  EXPECT_EQ(daemon.wait_exit(10s), 0);
  const auto lines = daemon.messages();
  ASSERT_GE(lines.size(), 2u);
  EXPECT_EQ(lines[lines.size() - 2], "open_and_bind_socket: bind failed\n");
  EXPECT_EQ(lines.back(), "main: open uevent fd failed\n");
  for (const std::string& l : lines) {
    EXPECT_EQ(l.find("thread"), std::string::npos) << "no thread was started: " << l;
  }
}

// The refresh request: frame type 34, the 16-bit value 260, 20 bytes, no earlier than 10 s after
// the thread started (and the thread starts after the 5 s start delay).
void expect_refresh_frame(std::chrono::milliseconds scale_5_plus_10, double scale) {
  kestrelctl::KernelPort kernel;
  ASSERT_TRUE(kernel.open_bound(100));
  const auto started = std::chrono::steady_clock::now();
  DaemonProcess daemon(DaemonEnv{{"KESTREL_TIME_SCALE", std::to_string(scale)}});
  auto frame = kernel.next_frame_of_type(34, scale_5_plus_10 + 10s);
  ASSERT_TRUE(frame) << daemon.output();
  EXPECT_GE(std::chrono::steady_clock::now() - started, scale_5_plus_10);
  EXPECT_THAT(frame->raw, ElementsAre(20, 0, 0, 0, 34, 0, 0, 0, 0, 0, 0, 0, 0x20, 0x4e, 0, 0, 0x04,
                                      0x01, 0, 0));
}

TEST(StartupTest, RefreshFrameComesTenScaledSecondsAfterTheThreadStarts) {
  expect_refresh_frame(scaled(15000ms), test_time_scale());
}

TEST(StartupTest, RefreshFrameAtRealTime) {
  expect_refresh_frame(15000ms, 1.0);
}

}  // namespace
