// kestrelctl end to end: the test plays kestreld on netlink port 20000, runs the program,
// checks the frame it sent, answers, and checks what it printed and its exit status.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "frame_codec.h"
#include "kernel_peer.h"

namespace kestrelctl {
namespace {

using std::chrono::milliseconds;

struct CtlResult {
  int status = -1;
  std::string out;
  std::string err;
};

// kestrelctl as a child process with its output on pipes.
class CtlProcess {
 public:
  explicit CtlProcess(const std::vector<std::string>& args,
                      const std::map<std::string, std::string>& env = {}) {
    if (pipe2(out_, O_CLOEXEC) != 0 || pipe2(err_, O_CLOEXEC) != 0) return;
    pid_ = fork();
    if (pid_ == 0) {
      dup2(out_[1], 1);
      dup2(err_[1], 2);
      for (const auto& e : env) setenv(e.first.c_str(), e.second.c_str(), 1);
      std::vector<char*> argv{const_cast<char*>(KESTRELCTL_BINARY)};
      for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
      argv.push_back(nullptr);
      execv(KESTRELCTL_BINARY, argv.data());
      _exit(127);
    }
    close(out_[1]);
    close(err_[1]);
  }

  ~CtlProcess() {
    if (pid_ > 0 && !finished_) {
      kill(pid_, SIGKILL);
      waitpid(pid_, nullptr, 0);
    }
    close(out_[0]);
    close(err_[0]);
  }

  // Everything the program printed, once it has ended (killed after 20 s).
  CtlResult finish() {
    CtlResult r;
    pollfd fds[2] = {{out_[0], POLLIN, 0}, {err_[0], POLLIN, 0}};
    std::string* sinks[2] = {&r.out, &r.err};
    int open = 2;
    while (open > 0 && poll(fds, 2, 20000) > 0) {
      for (int i = 0; i < 2; ++i) {
        if (fds[i].fd < 0 || fds[i].revents == 0) continue;
        char buf[4096];
        const ssize_t n = read(fds[i].fd, buf, sizeof buf);
        if (n > 0) {
          sinks[i]->append(buf, static_cast<size_t>(n));
        } else {
          fds[i].fd = -1;
          --open;
        }
      }
    }
    if (open > 0) kill(pid_, SIGKILL);
    int status = 0;
    waitpid(pid_, &status, 0);
    finished_ = true;
    r.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    return r;
  }

 private:
  int out_[2] = {-1, -1};
  int err_[2] = {-1, -1};
  pid_t pid_ = -1;
  bool finished_ = false;
};

CtlResult run(const std::vector<std::string>& args) {
  return CtlProcess(args).finish();
}

std::vector<uint8_t> words(const std::vector<int32_t>& w) {
  std::vector<uint8_t> b(w.size() * 4);
  if (!w.empty()) memcpy(b.data(), w.data(), b.size());
  return b;
}

// A frame as kestreld sends it to the kernel: nlmsg_len with the alignment bytes, pid 20000.
std::vector<uint8_t> daemon_frame(uint16_t type, const std::vector<uint8_t>& payload) {
  const uint32_t len = static_cast<uint32_t>(16 + ((payload.size() + 3) & ~size_t{3}));
  const uint32_t pid = 20000;
  std::vector<uint8_t> f(len, 0);
  memcpy(f.data(), &len, 4);
  memcpy(f.data() + 4, &type, 2);
  memcpy(f.data() + 12, &pid, 4);
  if (!payload.empty()) memcpy(f.data() + 16, payload.data(), payload.size());
  return f;
}

// The frame of a datagram as the peer reports it: nlmsg_len bytes, without the alignment.
std::vector<uint8_t> unpadded(std::vector<uint8_t> datagram) {
  uint32_t len = 0;
  memcpy(&len, datagram.data(), 4);
  datagram.resize(len);
  return datagram;
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  size_t start = 0;
  for (size_t nl; (nl = text.find('\n', start)) != std::string::npos; start = nl + 1) {
    out.push_back(text.substr(start, nl - start));
  }
  return out;
}

class KestrelctlCli : public testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(daemon_.ok()); }

  // The next frame kestrelctl sent to the daemon's port.
  KernelFrame command() {
    std::optional<KernelFrame> f = daemon_.receive(milliseconds(5000));
    EXPECT_TRUE(f.has_value()) << "kestrelctl sent nothing";
    return f.value_or(KernelFrame{});
  }

  void reply(uint16_t type, const std::vector<uint8_t>& payload) {
    ASSERT_TRUE(daemon_.send(daemon_frame(type, payload), 100));
  }

  // Sends to a listening kestrelctl, once its port is bound.
  void send_when_bound(const std::vector<uint8_t>& datagram) {
    for (int i = 0; i < 500 && !daemon_.send(datagram, 100); ++i) {
      std::this_thread::sleep_for(milliseconds(10));
    }
  }

  KernelPeer daemon_{20000};
};

TEST_F(KestrelctlCli, StatusPrintsTheDecodedReply) {
  CtlProcess ctl({"status", "light-short", "--timeout", "10"});
  const KernelFrame c = command();
  EXPECT_EQ(c.raw, build_command(0, {5}));
  EXPECT_EQ(c.sender, 100u);  // it waits on the kernel's port
  reply(0, {5, 1});
  const CtlResult r = ctl.finish();
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(r.out,
            "sent command 0 (get_status)  len 20  words 5\n"
            "type 0 (status)  len 20  pid 20000\n"
            "  sensor_type       5 (light-short)\n"
            "  no_response       1 (no answer within the daemon's wait)\n");
  EXPECT_EQ(r.err, "");
}

TEST_F(KestrelctlCli, NoReplyInTimeIsExitOne) {
  CtlProcess ctl({"calib", "read", "mag", "--timeout", "0.2"});
  EXPECT_EQ(command().raw, build_command(4, {2}));
  const CtlResult r = ctl.finish();
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, "sent command 4 (read_calib_data)  len 20  words 2\n");
  EXPECT_EQ(r.err, "kestrelctl: no reply (frame type 5) from kestreld within 0.2 s\n");
}

TEST_F(KestrelctlCli, FramesThatAreNotTheReplyAreMarkedOrSkipped) {
  std::vector<int32_t> accel(18, 0);
  accel[1] = 1;
  {
    CtlProcess ctl({"--json", "selftest", "accel", "--timeout", "10"});
    EXPECT_EQ(command().raw, build_command(8, {0}));
    reply(34, {4, 1});
    reply(9, words(accel));
    const CtlResult r = ctl.finish();
    EXPECT_EQ(r.status, 0);
    const std::vector<std::string> out = lines(r.out);
    ASSERT_EQ(out.size(), 3u) << r.out;
    EXPECT_EQ(out[0], "{\"sent\":{\"command\":8,\"name\":\"selftest\",\"len\":20,\"words\":[0]}}");
    EXPECT_EQ(out[1],
              "{\"type\":34,\"name\":\"hh_refresh\",\"len\":20,\"pid\":20000,"
              "\"fields\":{\"value\":260},\"payload\":\"04010000\",\"unrelated\":true}");
    EXPECT_EQ(out[2].rfind("{\"type\":9,\"name\":\"selftest\",\"len\":88,\"pid\":20000,\"fields\":"
                           "{\"sensor_type\":0,\"sensor\":\"accel\",\"result\":1,\"verdict\":"
                           "\"PASS\",",
                           0),
              0u)
        << out[2];
  }
  {
    // A dump that is not the one asked for is no reply either.
    std::vector<uint8_t> dump(129, 0);
    dump[0] = 2;
    CtlProcess ctl({"--quiet", "dump", "light", "--timeout", "10"});
    EXPECT_EQ(command().raw, build_command(19, {4}));
    reply(34, {4, 1});
    reply(20, dump);
    dump[0] = 4;
    reply(20, dump);
    const CtlResult r = ctl.finish();
    EXPECT_EQ(r.status, 0);
    const std::vector<std::string> out = lines(r.out);
    ASSERT_EQ(out.size(), 13u) << r.out;
    EXPECT_EQ(out[1], "type 20 (register_dump)  len 148  pid 20000");
    EXPECT_EQ(out[2], "  index             4 (light)");
    EXPECT_EQ(out[3], "  registers         0x80-0xff");
  }
}

TEST_F(KestrelctlCli, EachWaitingCommandSendsItsFrameAndTakesItsReply) {
  struct Case {
    std::vector<std::string> args;
    std::vector<uint8_t> frame;
    uint16_t reply_type;
    std::vector<uint8_t> reply;
  };
  const std::vector<uint8_t> gyro = words(std::vector<int32_t>(15, 1));
  const std::vector<uint8_t> selftest = words(std::vector<int32_t>(18, 3));
  const std::vector<uint8_t> mag = words(std::vector<int32_t>(9, 2));
  const std::vector<Case> cases = {
      {{"selftest", "gyro"}, build_command(8, {1}), 14, gyro},
      {{"selftest", "0x3"}, build_command(8, {3}), 9, selftest},
      {{"gyro-temp"}, build_command(10), 10, gyro},
      {{"mag", "fuserom"}, build_command(11), 11, mag},
      {{"mag", "registers"}, build_command(12), 12, mag},
      // The reply's type follows the filter state the sensor reported.
      {{"lpf", "on"}, build_command(15), 16, words({13, 0, 0})},
      {{"calib", "store", "light", "--flag", "1"}, build_command(6, {4, 1}), 7, words({5, 0})},
      {{"calib", "store", "accel"}, build_command(6, {0, 0}), 7, words({0, 0})},
      {{"dump", "1"}, build_command(19, {1}), 20, std::vector<uint8_t>(129, 1)},
      {{"status", "-1"}, build_command(0, {-1}), 0, {0xff, 0}},
      {{"bigdata", "31", "de ad", "beef"},
       build_bigdata(31, 4, {0xde, 0xad, 0xbe, 0xef}),
       33,
       words({0, 0, 7, 8})},
      {{"bigdata", "29", "00"}, build_bigdata(29, 4, {0}), 30, words({1, 2, 0, 0})},
  };
  for (const Case& c : cases) {
    std::vector<std::string> args = c.args;
    args.insert(args.end(), {"--timeout", "10"});
    CtlProcess ctl(args);
    EXPECT_EQ(command().raw, unpadded(c.frame)) << c.args[0];
    reply(c.reply_type, c.reply);
    const CtlResult r = ctl.finish();
    EXPECT_EQ(r.status, 0) << c.args[0] << r.err;
    const std::vector<std::string> out = lines(r.out);
    ASSERT_GE(out.size(), 2u) << c.args[0];
    EXPECT_EQ(out[1].rfind("type " + std::to_string(c.reply_type) + " (", 0), 0u) << out[1];
  }
}

TEST_F(KestrelctlCli, SendOnlyCommandsLeaveTheKernelPortFree) {
  KernelPeer listener(100);  // a `kestrelctl listen` elsewhere
  ASSERT_TRUE(listener.ok());
  struct Case {
    std::vector<std::string> args;
    std::vector<uint8_t> frame;
    std::string out;
  };
  const std::vector<Case> cases = {
      {{"send", "8", "0x10", "-1"},
       build_command(8, {16, -1}),
       "sent command 8 (selftest)  len 24  words 16 -1\n"},
      {{"raw", "14000000 0800 0000", "00000000 00000000", "00000000"},
       build_command(8, {0}),
       "sent 20 bytes: 14 00 00 00 08 00 00 00 00 00 00 00 00 00 00 00 00 00 00 00\n"},
      {{"hh", "set", "1", "2", "3", "4", "5", "6", "7", "8", "-9"},
       build_hidden_hole({1, 2, 3, 4, 5, 6, 7, 8, -9}),
       "sent command 35 (set_hidden_hole_data)  len 56  words 4 1 2 3 4 5 6 7 8 -9\n"},
      // The frame alone is checked for these: the printed line is the same as above.
      {{"motor", "off"}, build_command(18), ""},
      {{"hh-perms"}, build_command(36), ""},
      {{"diag", "stop"}, build_command(27, {0, 1}), ""},
      {{"diag", "dump"}, build_command(27, {0, 0}), ""},
      {{"diag", "states"}, build_command(27, {0, 2}), ""},
      {{"bigdata", "24", "01"},
       build_bigdata(24, 4, {1}),
       "sent command 24 (bigdata)  len 25  sensor_type 4  length 1  data 01\n"},
  };
  for (const Case& c : cases) {
    const CtlResult r = run(c.args);
    EXPECT_EQ(r.status, 0) << c.args[0] << r.err;
    if (!c.out.empty()) {
      EXPECT_EQ(r.out, c.out);
    }
    EXPECT_EQ(r.err, "");
    const KernelFrame f = command();
    EXPECT_EQ(f.raw, unpadded(c.frame)) << c.args[0];
    EXPECT_NE(f.sender, 100u);
  }

  // Commands the daemon never answers are sent and say so.
  CtlResult r = run({"selftest", "light"});
  EXPECT_EQ(r.status, 0);
  EXPECT_EQ(command().raw, build_command(8, {4}));
  EXPECT_EQ(r.err,
            "kestrelctl: no reply expected: the daemon replies to self tests of the accel, gyro, "
            "mag and pressure sensor types only\n");
}

TEST_F(KestrelctlCli, StreamPrintsSamplesUntilTheStopReply) {
  auto sample = [](int32_t code, int16_t x) {
    std::vector<uint8_t> p = words({code, 0, 0, 0});
    memcpy(p.data() + 4, &x, 2);
    return p;
  };
  CtlProcess ctl({"stream", "mag", "--seconds", "0.3", "--timeout", "10"});
  EXPECT_EQ(command().raw, build_command(1, {2}));
  reply(2, sample(2, 100));
  reply(34, {4, 1});
  reply(2, sample(2, -100));
  EXPECT_EQ(command().raw, build_command(3, {2}));
  reply(2, sample(2, 1));
  reply(3, words({2, 0}));
  const CtlResult r = ctl.finish();
  EXPECT_EQ(r.status, 0) << r.err;
  // The samples are printed as they come, before or after the stop was sent.
  std::vector<std::string> out = lines(r.out);
  ASSERT_EQ(out.size(), 9u) << r.out;
  const std::string stop_sent = "sent command 3 (stop_raw_data)  len 20  words 2";
  const auto at = std::find(out.begin(), out.end(), stop_sent);
  ASSERT_NE(at, out.end()) << r.out;
  out.erase(at);
  EXPECT_EQ(out, (std::vector<std::string>{
                     "sent command 1 (get_raw_data)  len 20  words 2",
                     "type 2 (sample)  len 32  pid 20000  code 2 (mag)  values x=100 y=0 z=0 "
                     "(15.00 0.00 0.00 \u00b5T)",
                     "type 34 (hh_refresh)  len 20  pid 20000  [unrelated]",
                     "  value             260 (refresh the light-sensor coefficients)",
                     "type 2 (sample)  len 32  pid 20000  code 2 (mag)  values x=-100 y=0 z=0 "
                     "(-15.00 0.00 0.00 \u00b5T)",
                     "type 2 (sample)  len 32  pid 20000  code 2 (mag)  values x=1 y=0 z=0 "
                     "(0.15 0.00 0.00 \u00b5T)",
                     "type 3 (stop)  len 24  pid 20000",
                     "  code              2 (mag)",
                 }));
}

TEST_F(KestrelctlCli, ListenStopsAfterCountOrSeconds) {
  {
    CtlProcess ctl({"listen", "--count", "2", "--seconds", "10"});
    std::vector<uint8_t> two = daemon_frame(34, {4, 1});
    const std::vector<uint8_t> second = daemon_frame(30, words({5, -3, 0, 0}));
    two.resize(two.size() + second.size());
    memcpy(two.data() + 20, second.data(), second.size());
    send_when_bound(two);
    const CtlResult r = ctl.finish();
    EXPECT_EQ(r.status, 0);
    EXPECT_EQ(r.out,
              "type 34 (hh_refresh)  len 20  pid 20000\n"
              "  value             260 (refresh the light-sensor coefficients)\n"
              "type 30 (threshold)  len 32  pid 20000\n"
              "  high              5\n"
              "  low               -3\n");
  }
  {
    CtlProcess ctl({"--json", "listen", "--count", "3", "--seconds", "0.3"});
    send_when_bound(daemon_frame(7, words({1, 0})));
    const CtlResult r = ctl.finish();
    EXPECT_EQ(r.status, 1);
    EXPECT_EQ(r.out,
              "{\"type\":7,\"name\":\"store_calibration\",\"len\":24,\"pid\":20000,\"fields\":"
              "{\"pdata_sensor_type\":1,\"sensor\":\"gyro\",\"result\":0},"
              "\"payload\":\"0100000000000000\"}\n");
    EXPECT_EQ(r.err, "kestrelctl: 1 of 3 frames within 0.3 s\n");
  }
}

TEST_F(KestrelctlCli, ChannelFailuresAreExitThree) {
  {
    KernelPeer other(100);
    ASSERT_TRUE(other.ok());
    const CtlResult r = run({"status", "accel", "--timeout", "10"});
    EXPECT_EQ(r.status, 3);
    EXPECT_EQ(r.err, "kestrelctl: port 100 is in use: is another kestrelctl listening?\n");
    EXPECT_EQ(r.out, "");
  }
  // The port that plays the kernel comes from the environment, as for the daemon.
  CtlProcess ctl({"gyro-temp", "--timeout", "10"}, {{"KESTREL_KERNEL_PORT", "4242"}});
  EXPECT_EQ(command().sender, 4242u);
  ASSERT_TRUE(daemon_.send(daemon_frame(10, words(std::vector<int32_t>(15, 11))), 4242));
  EXPECT_EQ(ctl.finish().status, 0);
  EXPECT_TRUE(daemon_.drain(milliseconds(50)).empty());
}

TEST(KestrelctlNoDaemon, SendWithoutADaemonIsExitThree) {
  const CtlResult r = run({"send", "0", "1"});
  EXPECT_EQ(r.status, 3);
  EXPECT_EQ(r.err,
            "kestrelctl: nothing listens on netlink port 20000: is kestreld running (in this "
            "network namespace)?\n");
}

TEST_F(KestrelctlCli, UsageErrorsAreExitTwoAndSendNothing) {
  const std::pair<std::vector<std::string>, std::string> cases[] = {
      {{}, "no command"},
      {{"status"}, "usage: kestrelctl status <sensor>"},
      {{"status", "gyro2"},
       "'gyro2' is no sensor: use accel, gyro, mag, pressure, light, light-short or a "
       "sensor_type number"},
      {{"bigdata", "27", "00"},
       "command 27 is no bulk-data command: use 22 to 26, 28, 29, 31 or 32"},
      {{"bigdata", "22", std::string(514, '0')},
       "bulk data of 257 bytes: the driver takes at most 256 (send anything else with raw)"},
      {{"send", "65536"}, "command 65536 does not fit the 16-bit nlmsg_type"},
      {{"raw", "123"}, "raw: odd number of hex digits"},
      {{"listen", "--flag", "1"}, "--flag does not apply to listen"},
      {{"calib", "read", "accel", "--flag", "1"}, "--flag applies to calib store only"},
      {{"status", "accel", "--timeout", "0"},
       "--timeout needs a number of seconds above 0, not '0'"},
      {{"lpf", "half"}, "usage: kestrelctl lpf on|off"},
      {{"frobnicate"}, "unknown command 'frobnicate'"},
      {{"--verbose", "status", "accel"}, "unknown option --verbose"},
  };
  for (const auto& c : cases) {
    const CtlResult r = run(c.first);
    EXPECT_EQ(r.status, 2) << c.second;
    EXPECT_EQ(r.err, "kestrelctl: " + c.second + "\nRun 'kestrelctl --help' for the commands.\n");
    EXPECT_EQ(r.out, "");
  }
  EXPECT_TRUE(daemon_.drain(milliseconds(50)).empty());

  const CtlResult help = run({"--help"});
  EXPECT_EQ(help.status, 0);
  EXPECT_EQ(help.out.rfind("kestrelctl plays the kernel factory driver", 0), 0u);
}

}  // namespace
}  // namespace kestrelctl
