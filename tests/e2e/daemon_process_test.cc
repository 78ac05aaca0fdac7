// SPDX-License-Identifier: Apache-2.0
// kestreld as a process, for what only a running daemon shows: its start-up and the exit status
// of each start-up failure, the receive loop walking real datagrams, the start-up thread's opens
// of the sensor service and a broken link's reopen tries, frames lost to an absent kernel, and
// libdiag failing at boot. The kernel is a KernelPort on port 100, the sensor processor an
// in-process simulator, the shell tools recording stand-ins.
#include <arpa/inet.h>
#include <dirent.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <functional>
#include <memory>
#include <set>
#include <thread>

#include "daemon_frames.h"
#include "daemon_process.h"
#include "kernel_port.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace {

using namespace std::chrono_literals;
using kestrelctl::build_command;
using kestrelctl::build_frame;
using kestrelctl::Frame;
using kestrelctl::KernelPort;
using ::testing::ElementsAre;

// Threads of a process (entries of /proc/<pid>/task); waits until there are n.
bool wait_for_tasks(pid_t pid, int n, std::chrono::milliseconds timeout) {
  return eventually(
      [&] {
        int count = 0;
        if (DIR* dir = opendir(("/proc/" + std::to_string(pid) + "/task").c_str())) {
          while (struct dirent* e = readdir(dir)) count += e->d_name[0] != '.';
          closedir(dir);
        }
        return count == n;
      },
      timeout);
}

// A running daemon with the kernel, the sensor processor and the shell tools around it.
class Rig {
 public:
  explicit Rig(bool healthy = true) : sim(test_socket_path(), healthy), kernel(std::in_place) {
    EXPECT_TRUE(kernel->open_bound(100));
  }

  void start(const DaemonEnv& env = {}) {
    daemon = std::make_unique<DaemonProcess>(env, tools.dir());
  }

  // The receive loop runs, the start-up threads have ended (leaving the main thread and the
  // sensor1 library's) and the first refresh frame has gone out.
  void wait_until_settled() {
    ASSERT_TRUE(daemon->wait_for("main: do while start = 0\n", 10s)) << daemon->output();
    ASSERT_TRUE(wait_for_tasks(daemon->pid(), 2, 10s)) << daemon->output();
    ASSERT_TRUE(kernel->next_frame_of_type(34, 10s)) << "the refresh frame of the start-up";
    run({});
  }

  // "message" for the daemon's records, "<tag>: message" for the stand-ins', of one thread (the
  // main thread's id is the process id) or of all.
  Lines texts(long tid = 0) const {
    Lines out;
    for (const LogRecord& r : daemon->records()) {
      if (tid == 0 || r.tid == tid) {
        out.push_back(r.tag == "KESTRELD" ? r.message : r.tag + ": " + r.message);
      }
    }
    return out;
  }

  // Sends one datagram, then a marker (a command number without an action, unique per call),
  // and returns the main thread's lines from the datagram's "left = n" to the loop's next
  // "do while start = n".
  Lines run(const Bytes& datagram) {
    const std::string marker = "process_message: " + std::to_string(next_marker_);
    if (!datagram.empty()) {
      EXPECT_TRUE(kernel->send(datagram));
    }
    EXPECT_TRUE(kernel->send(build_command(static_cast<uint16_t>(next_marker_++))));
    EXPECT_TRUE(daemon->wait_for(marker, 30s)) << daemon->output();
    const Lines main = texts(daemon->pid());
    const size_t m = std::find(main.begin() + seen_, main.end(), marker) - main.begin();
    Lines out(main.begin() + std::min(seen_, m), main.begin() + m - 1);  // not the marker's left
    seen_ = m + 2;                                                       // nor its "do while start"
    return out;
  }

  // The lines of the thread that wrote a line starting with first, from that line on.
  Lines thread_lines_from(const std::string& first) const {
    for (const LogRecord& r : daemon->records()) {
      if (r.message.rfind(first, 0) != 0) continue;
      const Lines t = texts(r.tid);
      return Lines(std::find(t.begin(), t.end(), r.message), t.end());
    }
    return {};
  }

  kestrel_sim::Simulator sim;
  std::optional<KernelPort> kernel;
  FakeTools tools;
  std::unique_ptr<DaemonProcess> daemon;

 private:
  int next_marker_ = 1000;
  size_t seen_ = 0;
};

// What the receive loop logs around the walk of a datagram of n bytes.
Lines walked(int n, const Lines& walk) {
  return Lines{"left = " + std::to_string(n)} + walk +
         Lines{"main: do while start = " + std::to_string(n) + "\n"};
}

std::string pm(int n) {
  return "process_message: " + std::to_string(n);
}

TEST(DaemonProcessTest, StartsInOrderThenRefreshesTheCoefficientsTenSecondsLater) {
  Rig rig;
  const auto started = std::chrono::steady_clock::now();
  rig.start();
  ASSERT_TRUE(rig.daemon->wait_for("main: do while start = 0\n", 10s)) << rig.daemon->output();
  EXPECT_GE(std::chrono::steady_clock::now() - started, scaled(5000ms)) << "the 5 s start delay";
  EXPECT_THAT(
      rig.texts(rig.daemon->pid()),
      ElementsAre("Factory Daemon Start!", "Factory Daemon Start! 2", "Factory Daemon Start! 3",
                  "Factory Daemon Start! 4", "main\n", "open_and_bind_socket: while 1 starting\n",
                  "main SNS_DIAG_ENABLE_LOGGING enable\n", "main pthread_create success\n",
                  "main read/update light coef efs file\n", "main hh_read_data_thread success\n",
                  "main: do while start = 0\n"));
  const std::optional<Frame> refresh = rig.kernel->next_frame_of_type(34, 10s);
  ASSERT_TRUE(refresh);
  EXPECT_GE(std::chrono::steady_clock::now() - started, scaled(15000ms));
  EXPECT_EQ(refresh->raw, daemon_frame(34, {0x04, 0x01}));
  EXPECT_EQ(rig.thread_lines_from("hh_read_data_thread start\n"),
            Lines{"hh_read_data_thread start\n"});
  EXPECT_TRUE(wait_for_tasks(rig.daemon->pid(), 2, 10s)) << "the start-up threads have ended";
}

// Starts a daemon whose start-up pause is long enough (scaled to 1 s) to lower its descriptor
// limit while it sleeps: free_slots more descriptors stay allowed.
void start_with_descriptor_limit(Rig& rig, int free_slots) {
  // Under AddressSanitizer the leak check at exit needs descriptors of its own.
  const char* asan = getenv("ASAN_OPTIONS");
  rig.start({{"KESTREL_TIME_SCALE", "0.2"},
             {"ASAN_OPTIONS", std::string(asan != nullptr ? asan : "") + ":detect_leaks=0"}});
  ASSERT_TRUE(rig.daemon->wait_for("Factory Daemon Start!", 10s));
  std::set<int> used;
  DIR* dir = opendir(("/proc/" + std::to_string(rig.daemon->pid()) + "/fd").c_str());
  ASSERT_NE(dir, nullptr);
  while (struct dirent* e = readdir(dir)) used.insert(e->d_name[0] != '.' ? atoi(e->d_name) : -1);
  closedir(dir);
  int limit = 0;
  for (int allowed = 0; allowed <= free_slots; ++limit) allowed += used.count(limit) == 0;
  const struct rlimit rl = {static_cast<rlim_t>(limit - 1), static_cast<rlim_t>(limit - 1)};
  ASSERT_EQ(prlimit(rig.daemon->pid(), RLIMIT_NOFILE, &rl, nullptr), 0) << strerror(errno);
}

TEST(DaemonProcessTest, StartUpFailuresEndTheProcessWithTheirStatus) {
  int held = -1;                       // the guard port, held by the test
  std::optional<KernelPort> squatter;  // the daemon's netlink port id, held by the test
  std::unique_ptr<DaemonProcess> first;
  const Lines before_channel = {"Factory Daemon Start!", "Factory Daemon Start! 2",
                                "Factory Daemon Start! 3", "Factory Daemon Start! 4", "main\n"};
  const Lines second = {"Factory Daemon Start!",
                        "Program is already running... can't run second instance!!!"};
  struct Case {
    const char* name;
    std::function<void(Rig&)> start;
    int status;
    Lines messages;
  };
  const Case cases[] = {
      {"sensor1_init fails",
       [](Rig& r) {
         r.start({{"KESTREL_SENSOR1_INIT_RESULT", "5"}});
       },
       6,
       {"Factory Daemon Start!", "Exiting! sensor1_init failed with 5"}},
      // Were sensor1_init reached, the status would be 6.
      {"another process holds the guard port",
       [&](Rig& r) {
         held = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
         struct sockaddr_in addr = {};
         addr.sin_family = AF_INET;
         addr.sin_port = htons(59234);
         ASSERT_EQ(bind(held, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr), 0);
         r.start({{"KESTREL_SENSOR1_INIT_RESULT", "5"}});
       },
       1, second},
      {"another kestreld runs",
       [&](Rig& r) {
         first = std::make_unique<DaemonProcess>();
         ASSERT_TRUE(first->wait_for("main: do while start = 0\n", 10s));
         r.start();
       },
       1, second},
      {"no descriptor left for the guard socket",
       [](Rig& r) { start_with_descriptor_limit(r, 0); },
       1,
       {"Factory Daemon Start!", "single instance - sock failed!\n"}},
      {"another socket holds the netlink port id",
       [&](Rig& r) {
         squatter.emplace();
         ASSERT_TRUE(squatter->open_bound(20000));
         r.start();
       },
       0,
       before_channel +
           Lines{"open_and_bind_socket: bind failed\n", "main: open uevent fd failed\n"}},
      // The guard's socket still gets a descriptor.
      {"no descriptor left for the netlink socket",
       [](Rig& r) { start_with_descriptor_limit(r, 1); }, 0,
       before_channel +
           Lines{"open_and_bind_socket: socket failed (-1)\n", "main: open uevent fd failed\n"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    {
      Rig rig;
      c.start(rig);
      ASSERT_TRUE(rig.daemon);
      EXPECT_EQ(rig.daemon->wait_exit(10s), c.status);
      ASSERT_TRUE(rig.daemon->wait_for(c.messages.back(), 5s)) << rig.daemon->output();
      EXPECT_EQ(rig.daemon->messages(), c.messages);
      EXPECT_EQ(rig.sim.opened_connections(), first ? 1 : 0) << "no start-up thread ran";
    }
    EXPECT_FALSE(first && first->wait_exit(0ms)) << "the first daemon runs on";
    first.reset();
    squatter.reset();
    if (held >= 0) close(held);
    held = -1;
  }
}

TEST(DaemonProcessTest, TheReceiveLoopWalksEachDatagramByTheNetlinkRules) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  Bytes full;  // 64 frames fill the receive buffer
  Lines full_walk;
  for (int i = 0; i < 64; ++i) {
    full = full + build_command(static_cast<uint16_t>(40 + i));
    full_walk.push_back(pm(40 + i));
  }
  const std::string malformed = "process_message: malformed netlink message\n";
  const std::pair<Bytes, Lines> cases[] = {
      {Bytes(15, 0xff), walked(15, {})},  // under a header's worth of bytes
      {build_command(2, {7}) + build_command(5), walked(36, {pm(2), pm(5)})},
      // nlmsg_len 17 in an 18-byte datagram: handled; its aligned length (20) ends the walk.
      {build_frame(7, {0xAA, 0xBB}, 17), walked(18, {pm(7)})},
      // nlmsg_len below a header or beyond the datagram: the rest is dropped.
      {build_frame(2, {}, 0), walked(16, {malformed})},
      {build_command(9) + build_frame(2, {1, 2, 3, 4}, 24), walked(36, {pm(9), malformed})},
      {build_command(65535), walked(16, {pm(65535)})},  // numbers above 36 are only logged
      {full, walked(1024, full_walk)},
      // Frames too short for their command's fields are refused; the walk goes on.
      {build_command(0) + build_command(9),
       walked(32, {pm(0),
                   "process_message: NETLINK_MESSAGE_GET_STATUS refused: frame of 16 bytes, "
                   "needs 20",
                   pm(9)})},
      {build_command(35, {4, 1, 2, 3, 4, 5, 6, 7, 8}),
       walked(52, {pm(35),
                   "process_message: NETLINK_MESSAGE_SET_HIDDEN_HOLE_DATA refused: frame "
                   "of 52 bytes, needs 56"})},
      {build_command(27, {0}),
       walked(20, {pm(27),
                   "process_message: NETLINK_MESSAGE_DIAG_LOGGING refused: frame of 20 "
                   "bytes, needs 24"})},
      // The fields are judged by nlmsg_len, not by what follows it in the datagram.
      {build_frame(19, {1, 0, 0, 0}, 17),
       walked(20, {pm(19),
                   "process_message: NETLINK_MESSAGE_DUMP_REGISTER refused: frame of 17 "
                   "bytes, needs 20"})},
      {build_command(19, {6}),
       walked(20, {pm(19), "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type error"})},
  };
  for (const auto& [datagram, lines] : cases) EXPECT_EQ(rig.run(datagram), lines);
  EXPECT_TRUE(rig.kernel->drain(0ms).empty()) << "no reply";
  EXPECT_THAT(rig.sim.requests(), ::testing::IsEmpty()) << "nothing reached the sensor service";
}

std::string would_block(int retry) {
  return "sensor1_open_or_reopen: sensor1_open returned EWOULDBLOCK.Daemon not ready, will try "
         "again (retry = " +
         std::to_string(retry) + ")";
}

Lines fifty_refused_opens() {
  Lines out;
  for (int retry = 50; retry >= 1; --retry) {
    out = out + Lines{"libsensor1: open -> 11", would_block(retry)};
  }
  return out;
}

Lines opens_only(const Lines& lines) {
  Lines out;
  for (const std::string& l : lines) {
    if (l.rfind("libsensor1: open", 0) == 0 || l.rfind("sensor1_open_or_reopen", 0) == 0) {
      out.push_back(l);
    }
  }
  return out;
}

TEST(DaemonProcessTest, ABrokenLinkWithTheServiceGoneMakesThreeReopenTries) {
  Rig rig;
  rig.sim.refuse_opens(5, 10);
  // One reopen try is a second: scaled to 0.5 s here, so that three and four tell apart with
  // room for a loaded machine.
  rig.start({{"KESTREL_TIME_SCALE", "0.5"}});
  rig.wait_until_settled();
  Lines refused;
  for (int i = 0; i < 10; ++i) {
    refused = refused +
              Lines{"libsensor1: open -> 5", "sensor1_open_or_reopen: sensor1_open() failed ret=5"};
  }
  EXPECT_EQ(
      opens_only(rig.thread_lines_from("diag_logging_start_thread start\n")),
      refused + Lines({"libsensor1: open -> 0", "sensor1_open_or_reopen: sensor1_open success\n"}));

  // The success gave the budget back its 50 attempts; the first of the three tries spends them,
  // the other two try nothing, a (scaled) second apart.
  rig.sim.stop_listening();
  rig.sim.drop_connection();
  ASSERT_TRUE(rig.daemon->wait_for("open -> 11", 10s, 1, "libsensor1"));
  const auto first_try = std::chrono::steady_clock::now();
  ASSERT_TRUE(rig.daemon->wait_for("BROKEN_PIPE fail to open sensor1\n", 10s));
  const auto tries = std::chrono::steady_clock::now() - first_try;
  EXPECT_GT(tries, 875ms) << "two more tries";
  EXPECT_LT(tries, 1375ms) << "not three";
  EXPECT_EQ(opens_only(rig.thread_lines_from("BROKEN_PIPE sensor1_handle")), fifty_refused_opens());
  EXPECT_EQ(rig.tools.calls(), Lines({kStart, kStop})) << "logging stopped with the link";
  const std::optional<Frame> refresh = rig.kernel->next_frame_of_type(34, 10s);
  ASSERT_TRUE(refresh) << "a new refresh thread runs";
  EXPECT_EQ(refresh->raw, daemon_frame(34, {0x04, 0x01}));
}

TEST(DaemonProcessTest, FramesToAnAbsentKernelAreLostWithoutATrace) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  // Nobody holds the kernel's port: the report cannot be delivered. The commands come from
  // another port id; the daemon takes datagrams from any sender.
  rig.kernel.emplace();
  ASSERT_TRUE(rig.kernel->open_bound(101));
  EXPECT_EQ(rig.run(build_command(4, {3})),
            walked(20, {pm(4), "read_calib_data: sensor_type 3\n", "libsensor_reg: open -> 0",
                        "Inside While 0, count 50", "Outside While 0",
                        "read_calib_data: ID=30, Type=3, Result=-1, Val=0,0,0",
                        "libsensor_reg: close -> 0"}));
  // Once the port is held again, the next report arrives, and only that one.
  KernelPort kernel;
  ASSERT_TRUE(kernel.open_bound(100));
  ASSERT_TRUE(kernel.send(build_command(4, {0})));
  const std::optional<Frame> report = kernel.next_frame(10s);
  ASSERT_TRUE(report);
  EXPECT_EQ(report->raw, word_frame(5, {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1}));
  EXPECT_FALSE(rig.daemon->wait_exit(0ms));
}

TEST(DaemonProcessTest, LibdiagFailingAtBootLeavesLoggingOff) {
  const Lines checks = {"check_property Success\n", "check_files is not exist -1\n"};
  const std::pair<DaemonEnv, Lines> cases[] = {
      {{{"KESTREL_DIAG_INIT", "fail"}},
       checks + Lines{"libdiag: Diag_LSM_Init fail", "sns_set_diag_mode: Diag_LSM_Init failed\n",
                      "libdiag: Diag_LSM_DeInit",
                      "sns_set_diag_tx_mode: sns_set_diag_mode result: -1\n"}},
      {{{"KESTREL_DIAG_TX_MODE_RESULT", "0"}},
       checks + Lines{"libdiag: Diag_LSM_Init ok",
                      "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
                      "libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 0",
                      "sns_set_diag_mode: Failed configuring the peripheral tx_mode, result: 0\n",
                      "libdiag: Diag_LSM_DeInit",
                      "sns_set_diag_tx_mode: sns_set_diag_mode result: 0\n"}},
  };
  for (const auto& [env, decision] : cases) {
    SCOPED_TRACE(env.begin()->first);
    Rig rig;
    rig.start(env);
    rig.wait_until_settled();
    EXPECT_EQ(
        rig.thread_lines_from("diag_logging_start_thread start\n"),
        Lines({"diag_logging_start_thread start\n", "libsensor1: open -> 0",
               "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:0\n"}) +
            decision);
    // Logging is off: a dump finds nothing to dump, and the tool never ran.
    EXPECT_EQ(rig.run(build_command(27, {0, 0})),
              (walked(24, {pm(27), "diag : Diabled Logging System\n"})));
    EXPECT_TRUE(rig.tools.calls().empty());
  }
}

}  // namespace
