// The frame walk on the running daemon, with a real netlink socket playing the kernel driver.
// Each case is one datagram followed by a sentinel frame (a command number above 36, which only
// logs its number), so the lines of a case are exactly those between two sentinels.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "daemon_process.h"
#include "kernel_port.h"

using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using namespace std::chrono_literals;

namespace {

using kestrelctl::build_command;
using kestrelctl::build_frame;

class FrameWalkTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(kernel.open_bound(100));
    daemon = std::make_unique<DaemonProcess>();
    ASSERT_TRUE(daemon->wait_for("main: do while start = 0\n", 10s)) << daemon->output();
    send_sentinel();
  }

  void send_sentinel() {
    ++sentinel;
    ASSERT_TRUE(kernel.send(build_command(static_cast<uint16_t>(sentinel))));
    ASSERT_TRUE(daemon->wait_for("process_message: " + std::to_string(sentinel), 10s))
        << daemon->output();
  }

  // The walk's lines (and the receive loop's "left = %d") for one datagram.
  std::vector<std::string> walk(const std::vector<uint8_t>& datagram) {
    const std::string before = "process_message: " + std::to_string(sentinel);
    EXPECT_TRUE(kernel.send(datagram));
    send_sentinel();
    const std::string after = "process_message: " + std::to_string(sentinel);
    std::vector<std::string> out;
    bool inside = false;
    for (const std::string& m : daemon->messages()) {
      if (m == before) {
        inside = true;
      } else if (m == after) {
        break;
      } else if (inside && (m.rfind("process_message", 0) == 0 || m.rfind("left = ", 0) == 0)) {
        out.push_back(m);
      }
    }
    // The sentinel's own "left = 16" closes every case.
    if (!out.empty() && out.back() == "left = 16") out.pop_back();
    return out;
  }

  kestrelctl::KernelPort kernel;
  std::unique_ptr<DaemonProcess> daemon;
  int sentinel = 1000;
};

std::vector<uint8_t> concat(std::vector<uint8_t> a, const std::vector<uint8_t>& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

TEST_F(FrameWalkTest, WalksFramesWithTheNetlinkRules) {
  // Under a header's worth of bytes: the walk logs nothing.
  EXPECT_THAT(walk(std::vector<uint8_t>(15, 0xff)), ElementsAre("left = 15"));

  // Two frames in one datagram run in order: a 20-byte frame, then one without payload.
  EXPECT_THAT(walk(concat(build_command(2, {7}), build_command(5))),
              ElementsAre("left = 36", "process_message: 2", "process_message: 5"));

  // nlmsg_len 17 in an 18-byte datagram: handled; its aligned length (20) ends the walk.
  {
    std::vector<uint8_t> d = build_frame(7, {0xAA, 0xBB}, 17);
    ASSERT_EQ(d.size(), 18u);
    EXPECT_THAT(walk(d), ElementsAre("left = 18", "process_message: 7"));
  }

  // nlmsg_len below a header or beyond the datagram: one malformed line, the rest dropped, and
  // the frames before it already handled.
  EXPECT_THAT(walk(build_frame(2, {}, 0)),
              ElementsAre("left = 16", "process_message: malformed netlink message\n"));
  EXPECT_THAT(walk(concat(build_command(9), build_frame(2, {1, 2, 3, 4}, 24))),
              ElementsAre("left = 36", "process_message: 9",
                          "process_message: malformed netlink message\n"));

  // Numbers above 36 are only logged.
  EXPECT_THAT(walk(build_command(65535)), ElementsAre("left = 16", "process_message: 65535"));
}

TEST_F(FrameWalkTest, FramesTooShortForTheirFieldsAreRefusedAndTheWalkGoesOn) {
  // Command 0 reads sensor_type at offset 16: a 16-byte frame cannot hold it. The next frame of
  // the datagram still runs.
  EXPECT_THAT(
      walk(concat(build_command(0), build_command(9))),
      ElementsAre(
          "left = 32", "process_message: 0",
          "process_message: NETLINK_MESSAGE_GET_STATUS refused: frame of 16 bytes, needs 20",
          "process_message: 9"));
  // Command 35 reads ten words; a frame with nine is refused.
  EXPECT_THAT(walk(build_command(35, {4, 1, 2, 3, 4, 5, 6, 7, 8})),
              ElementsAre("left = 52", "process_message: 35",
                          "process_message: NETLINK_MESSAGE_SET_HIDDEN_HOLE_DATA refused: frame of "
                          "52 bytes, needs 56"));
  // Command 27 reads its argument at offset 20.
  EXPECT_THAT(walk(build_command(27, {0})),
              ElementsAre("left = 20", "process_message: 27",
                          "process_message: NETLINK_MESSAGE_DIAG_LOGGING refused: frame of 20 "
                          "bytes, needs 24"));
  // A frame whose nlmsg_len says 17 while its datagram carries more: the fields are judged by
  // nlmsg_len, not by what happens to follow it in the buffer.
  EXPECT_THAT(walk(build_frame(19, {1, 0, 0, 0}, 17)),
              ElementsAre("left = 20", "process_message: 19",
                          "process_message: NETLINK_MESSAGE_DUMP_REGISTER refused: frame of 17 "
                          "bytes, needs 20"));
}

TEST_F(FrameWalkTest, AFullBufferOfFramesIsWalkedToTheEnd) {
  std::vector<uint8_t> d;
  std::vector<std::string> expected = {"left = 1024"};
  for (int i = 0; i < 64; ++i) {
    d = concat(d, build_command(static_cast<uint16_t>(40 + i)));
    expected.push_back("process_message: " + std::to_string(40 + i));
  }
  ASSERT_EQ(d.size(), 1024u);
  EXPECT_THAT(walk(d), ElementsAreArray(expected));
}

}  // namespace
