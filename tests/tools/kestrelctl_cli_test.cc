// SPDX-License-Identifier: Apache-2.0
// kestrelctl end to end: the test plays kestreld on netlink port 20000, runs the program,
// checks the frame it sent, answers, and checks what it printed and its exit status.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/wait.h>

#include <future>
#include <string>
#include <tuple>

#include "daemon_frames.h"
#include "frame_codec.h"
#include "kernel_port.h"
#include "test_env.h"

namespace kestrelctl {
namespace {

struct Result {
  int status = -1;
  std::string out, err;
};

// kestrelctl with args (shell words); the test goes on while it runs.
std::future<Result> start(const std::string& args) {
  const std::string out = test_socket_path() + ".ctl";
  return std::async(std::launch::async, [=] {
    const int status =
        system((KESTRELCTL_BINARY " " + args + " >" + out + ".out 2>" + out + ".err").c_str());
    const Result r{WIFEXITED(status) ? WEXITSTATUS(status) : -1, read_file(out + ".out"),
                   read_file(out + ".err")};
    system(("rm -f " + out + ".out " + out + ".err").c_str());
    return r;
  });
}

class KestrelctlCli : public testing::Test {
 protected:
  // The next frame kestrelctl sent to the daemon's port.
  Frame command() { return daemon.next_frame(std::chrono::seconds(5)).value_or(Frame{}); }

  void SetUp() override { ASSERT_TRUE(daemon.open_bound(20000)); }

  KernelPort daemon;
};

TEST_F(KestrelctlCli, AReplyIsDecodedAndNoReplyIsExitOne) {
  std::future<Result> ctl = start("status light-short --timeout 10");
  const Frame c = command();
  EXPECT_EQ(c.raw, build_command(0, {5}));
  EXPECT_EQ(c.sender, 100u);                                   // it waits on the kernel's port
  ASSERT_TRUE(daemon.send_to(100, daemon_frame(34, {4, 1})));  // not the reply: marked
  ASSERT_TRUE(daemon.send_to(100, daemon_frame(0, {5, 1})));
  Result r = ctl.get();
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out,
            "sent command 0 (get_status)  len 20  words 5\n"
            "type 34 (hh_refresh)  len 20  pid 20000  [unrelated]\n"
            "  value             260 (refresh the light-sensor coefficients)\n"
            "type 0 (status)  len 20  pid 20000\n"
            "  sensor_type       5 (light-short)\n"
            "  no_response       1 (no answer within the daemon's wait)\n");
  EXPECT_EQ(r.err, "");

  r = start("calib read mag --timeout 0.2").get();
  EXPECT_EQ(command().raw, build_command(4, {2}));
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "sent command 4 (read_calib_data)  len 20  words 2\n");
  EXPECT_EQ(r.err, "kestrelctl: no reply (frame type 5) from kestreld within 0.2 s\n");
}

// Each command that only sends, from a port of its own (the kernel's is left to a listener
// elsewhere): its frame (bulk data without its alignment bytes) and what it prints when checked.
// A usage error (no frame) is exit 2 and sends nothing.
TEST_F(KestrelctlCli, EachCommandSendsItsFrameOrIsAUsageError) {
  KernelPort listener;  // a `kestrelctl listen` elsewhere
  ASSERT_TRUE(listener.open_bound(100));
  const std::tuple<std::string, Bytes, std::string> cases[] = {
      // clang-format off
      {"send 8 0x10 -1", build_command(8, {16, -1}),
       "sent command 8 (selftest)  len 24  words 16 -1\n"},
      {"raw '14000000 0800 0000' 00000000 00000000 00000000", build_command(8, {0}),
       "sent 20 bytes: 14 00 00 00 08 00 00 00 00 00 00 00 00 00 00 00 00 00 00 00\n"},
      {"hh set 1 2 3 4 5 6 7 8 -9", build_hidden_hole({1, 2, 3, 4, 5, 6, 7, 8, -9}),
       "sent command 35 (set_hidden_hole_data)  len 56  words 4 1 2 3 4 5 6 7 8 -9\n"},
      {"bigdata 24 0102", build_bigdata(24, 4, {1, 2}),
       "sent command 24 (bigdata)  len 26  sensor_type 4  length 2  data 01 02\n"},
      {"motor off", build_command(18), ""},
      {"diag stop", build_command(27, {0, 1}), ""},
      {"diag states", build_command(27, {0, 2}), ""},
      {"selftest light", build_command(8, {4}), ""},  // which the daemon never answers
      {"", {}, "no command"},
      {"status gyro2", {}, "'gyro2' is no sensor: use accel, gyro, mag, pressure, light, "
                           "light-short or a sensor_type number"},
      {"bigdata 27 00", {}, "command 27 is no bulk-data command: use 22 to 26, 28, 29, 31 or 32"},
      {"bigdata 22 " + std::string(514, '0'), {},
       "bulk data of 257 bytes: the driver takes at most 256 (send anything else with raw)"},
      {"send 65536", {}, "command 65536 does not fit the 16-bit nlmsg_type"},
      {"raw 123", {}, "raw: odd number of hex digits"},
      {"calib read accel --flag 1", {}, "--flag applies to calib store only"},
      {"status accel --seconds 1", {}, "--seconds applies to stream, listen and decode --live only"},
      {"decode x.pcap --pcap y.pcap", {}, "--pcap does not apply to decode"},
      {"mag fuse", {}, "usage: kestrelctl mag fuserom | mag registers"},
      {"decode --live lo x", {}, "usage: kestrelctl decode --live IFACE [--seconds N] [--pcap FILE] "
                                 "[--csv FILE] [--plot FILE]"},
      {"status accel --timeout 0", {}, "--timeout needs a number of seconds above 0, not '0'"},
      {"--verbose status accel", {}, "unknown option --verbose"},
      // clang-format on
  };
  for (const auto& [args, frame, text] : cases) {
    const Result r = start(args).get();  // exit 3 if it took the kernel's port
    if (frame.empty()) {
      EXPECT_EQ(r.status, 2) << args;
      EXPECT_EQ(r.err, "kestrelctl: " + text + "\nRun 'kestrelctl --help' for the commands.\n");
      EXPECT_EQ(r.out, "");
      continue;
    }
    EXPECT_EQ(r.status, 0) << args << r.err;
    EXPECT_TRUE(text.empty() || r.out == text) << r.out;
    EXPECT_EQ(command().raw, Bytes(frame.begin(), frame.begin() + load_u32(frame.data(), 0)));
  }
  EXPECT_TRUE(daemon.drain(std::chrono::milliseconds(50)).empty());
}

TEST(KestrelctlChannel, PortInUseAndNoDaemonAreExitThree) {
  KernelPort other;
  ASSERT_TRUE(other.open_bound(100));
  Result r = start("status accel --timeout 10").get();
  EXPECT_EQ(r.status, 3);
  EXPECT_EQ(r.err, "kestrelctl: port 100 is in use: is another kestrelctl listening?\n");
  r = start("send 0 1").get();
  EXPECT_EQ(r.status, 3);
  EXPECT_EQ(r.err,
            "kestrelctl: nothing listens on netlink port 20000: is kestreld running (in this "
            "network namespace)?\n");
}

}  // namespace
}  // namespace kestrelctl
