// The daemon's failure paths, end to end: kestreld runs as a child process, the kernel driver is
// played on port 100, the sensor processor by an in-process simulator, the shell tools by
// recording stand-ins. Each case drives one failure through the stand-ins' knobs and then checks
// that the daemon still serves (a command answered after the fault) or has ended with the status
// it must end with. The requests' own allocation and write failures are in
// request_fault_matrix_test.cc.
#include <arpa/inet.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/netlink.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <iostream>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "tests/e2e/matrix_support.h"

namespace {

using namespace matrix;
using kestrel_sim::Header;
using ::testing::ElementsAre;
using ::testing::ElementsAreArray;
using ::testing::IsEmpty;

const char kStartTool[] =
    "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c";
const char kStopTool[] = "diag_mdlog -k -p 16";

std::string would_block(int retry) {
  return "sensor1_open_or_reopen: sensor1_open returned EWOULDBLOCK.Daemon not ready, will try "
         "again (retry = " +
         std::to_string(retry) + ")";
}

// The attempts of one exhausted open budget, as the thread that makes them logs them.
Lines fifty_refused_opens() {
  Lines out;
  for (int retry = 50; retry >= 1; --retry) {
    out.push_back("libsensor1: open -> 11");
    out.push_back(would_block(retry));
  }
  return out;
}

Lines operator+(Lines a, const Lines& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// The lines of the thread that wrote first_text, from that line on. The handle's address in the
// broken-pipe line differs from run to run and is replaced by "<handle>".
Lines thread_lines_from(const Rig& rig, const std::string& first_text) {
  const std::vector<Line> log = rig.log();
  Lines all = thread_texts(log, thread_of(log, first_text));
  auto first = std::find(all.begin(), all.end(), first_text);
  Lines out(first, all.end());
  for (std::string& l : out) {
    if (starts_with(l, "BROKEN_PIPE sensor1_handle 0x")) {
      l = "BROKEN_PIPE sensor1_handle <handle>\n";
    }
  }
  return out;
}

// A reply payload of signed 32-bit words.
std::vector<uint8_t> payload(const std::vector<int32_t>& words) {
  std::vector<uint8_t> out(words.size() * 4);
  if (!words.empty()) memcpy(out.data(), words.data(), out.size());
  return out;
}

// The frame as the daemon sends it: header (nlmsg_pid 20000) and payload with its alignment.
std::vector<uint8_t> frame_bytes(uint16_t type, std::vector<uint8_t> body) {
  const uint32_t len = (static_cast<uint32_t>(body.size()) + 19) & ~3u;
  std::vector<uint8_t> f(16, 0);
  memcpy(f.data(), &len, 4);
  memcpy(f.data() + 4, &type, 2);
  const uint32_t pid = 20000;
  memcpy(f.data() + 12, &pid, 4);
  body.resize(len - 16, 0);
  f.insert(f.end(), body.begin(), body.end());
  return f;
}

std::vector<std::vector<uint8_t>> raw_frames(const Outcome& o) {
  std::vector<std::vector<uint8_t>> out;
  for (const KernelFrame& f : o.frames) out.push_back(f.raw);
  return out;
}

// The self-test reply of the accelerometer from its eight result words.
std::vector<uint8_t> accel_reply(const std::vector<int32_t>& w) {
  std::vector<int32_t> r(18, 0);
  r[1] = w[0];
  r[2] = w[4];
  r[3] = w[5];
  r[4] = w[6];
  r[5] = w[7];
  r[6] = w[1];
  r[7] = w[2];
  r[8] = w[3];
  return frame_bytes(9, payload(r));
}

// The healthy phone's accelerometer self test.
const std::vector<int32_t> kHealthyAccel = {1, 12, -8, 1003, 1, 310, -295, 380};

// A wait on the command waiter that ran out.
Lines waited_in_vain(const std::string& requester) {
  return {"waiting for response IN - timeout=8000",
          "wait_for_response: pthread_cond_timedwait() rc=110",
          "wait_for_response: response received.", requester + ": ERROR: No response for command"};
}

int hold_guard_port() {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
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

// The descriptor numbers a process has open.
std::set<int> open_descriptors(pid_t pid) {
  std::set<int> out;
  DIR* dir = opendir(("/proc/" + std::to_string(pid) + "/fd").c_str());
  if (dir == nullptr) return out;
  while (struct dirent* e = readdir(dir)) {
    if (e->d_name[0] != '.') out.insert(atoi(e->d_name));
  }
  closedir(dir);
  return out;
}

// Starts a daemon whose 5 s start-up pause is long enough (scaled to 1 s) to lower its descriptor
// limit while it sleeps: free_slots of the descriptors it will open next stay allowed.
void start_with_descriptor_limit(Rig& rig, int free_slots) {
  // Under AddressSanitizer the leak check at exit needs descriptors of its own, which this
  // daemon no longer has: it is left out for this process.
  const char* asan = getenv("ASAN_OPTIONS");
  rig.start({{"KESTREL_TIME_SCALE", "0.2"},
             {"ASAN_OPTIONS", std::string(asan != nullptr ? asan : "") + ":detect_leaks=0"}});
  ASSERT_TRUE(rig.daemon->wait_for("Factory Daemon Start!", 10s));
  const std::set<int> used = open_descriptors(rig.daemon->pid());
  int limit = 0;
  for (int allowed = 0; allowed <= free_slots; ++limit) {
    if (used.count(limit) == 0) ++allowed;
  }
  --limit;  // the first descriptor number that must not be given out
  const struct rlimit rl = {static_cast<rlim_t>(limit), static_cast<rlim_t>(limit)};
  ASSERT_EQ(prlimit(rig.daemon->pid(), RLIMIT_NOFILE, &rl, nullptr), 0) << strerror(errno);
}

TEST(FaultMatrix, StartUpFailuresEndTheProcessWithTheirStatus) {
  {
    SCOPED_TRACE("sensor1_init fails");
    Rig rig;
    rig.start({{"KESTREL_SENSOR1_INIT_RESULT", "5"}});
    EXPECT_EQ(rig.daemon->wait_exit(10s), 6);
    ASSERT_TRUE(rig.wait_for_text("Exiting! sensor1_init failed with 5", 5s));
    EXPECT_THAT(rig.daemon->messages(),
                ElementsAre("Factory Daemon Start!", "Exiting! sensor1_init failed with 5"));
    EXPECT_EQ(rig.sim.opened_connections(), 0);
  }
  {
    SCOPED_TRACE("another process holds the guard port");
    const int held = hold_guard_port();
    ASSERT_GE(held, 0);
    Rig rig;
    // Were sensor1_init reached, the status would be 6.
    rig.start({{"KESTREL_SENSOR1_INIT_RESULT", "5"}});
    EXPECT_EQ(rig.daemon->wait_exit(10s), 1);
    ASSERT_TRUE(
        rig.wait_for_text("Program is already running... can't run second instance!!!", 5s));
    EXPECT_THAT(rig.daemon->messages(),
                ElementsAre("Factory Daemon Start!",
                            "Program is already running... can't run second instance!!!"));
    close(held);
  }
  {
    SCOPED_TRACE("no descriptor left for the guard socket");
    Rig rig;
    start_with_descriptor_limit(rig, 0);
    EXPECT_EQ(rig.daemon->wait_exit(10s), 1);
    ASSERT_TRUE(rig.wait_for_text("single instance - sock failed!\n", 5s));
    EXPECT_THAT(rig.daemon->messages(),
                ElementsAre("Factory Daemon Start!", "single instance - sock failed!\n"));
  }
  const Lines before_channel = {"Factory Daemon Start!", "Factory Daemon Start! 2",
                                "Factory Daemon Start! 3", "Factory Daemon Start! 4", "main\n"};
  {
    SCOPED_TRACE("another socket holds the netlink port id");
    KernelPeer squatter(20000);
    ASSERT_TRUE(squatter.ok());
    Rig rig;
    rig.start();
    EXPECT_EQ(rig.daemon->wait_exit(10s), 0);
    ASSERT_TRUE(rig.wait_for_text("main: open uevent fd failed\n", 5s));
    EXPECT_EQ(rig.daemon->messages(), before_channel + Lines({"open_and_bind_socket: bind failed\n",
                                                              "main: open uevent fd failed\n"}));
    EXPECT_EQ(rig.sim.opened_connections(), 0) << "no start-up thread ran";
  }
  {
    SCOPED_TRACE("no descriptor left for the netlink socket");
    Rig rig;
    start_with_descriptor_limit(rig, 1);  // the guard's socket still gets one
    EXPECT_EQ(rig.daemon->wait_exit(10s), 0);
    ASSERT_TRUE(rig.wait_for_text("main: open uevent fd failed\n", 5s));
    EXPECT_EQ(rig.daemon->messages(),
              before_channel + Lines({"open_and_bind_socket: socket failed (-1)\n",
                                      "main: open uevent fd failed\n"}));
    EXPECT_EQ(rig.sim.opened_connections(), 0);
  }
}

TEST(FaultMatrix, AServiceThatRefusesEveryOpenCostsFiftyAttemptsThenNothing) {
  Rig rig;
  rig.sim.refuse_opens(11, 50);
  rig.start();
  ASSERT_TRUE(rig.wait_for_text(would_block(1), 10s)) << rig.daemon->output();
  // Both start-up threads end; without a connection the sensor1 library has no thread either.
  ASSERT_TRUE(wait_for_tasks(rig.daemon->pid(), 1, 10s));
  rig.sync();
  Lines attempts;
  for (const std::string& l : thread_lines_from(rig, "diag_logging_start_thread start\n")) {
    if (starts_with(l, "libsensor1: open") || starts_with(l, "sensor1_open_or_reopen")) {
      attempts.push_back(l);
    }
  }
  EXPECT_EQ(attempts, fifty_refused_opens());

  // The budget is spent: the requests get the empty handle and fail at their allocation, without
  // a new attempt, although the service would now accept.
  const Outcome status = rig.run(command_frame(0, {0}));
  EXPECT_THAT(status.lines,
              ElementsAre("process_message: 0", "[get_status]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_THAT(status.frames, IsEmpty());
  const Outcome selftest = rig.run(command_frame(8, {0}));
  EXPECT_THAT(selftest.lines,
              ElementsAre("process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
                          "[get_selftest_result]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_THAT(raw_frames(selftest), ElementsAre(accel_reply({0, 0, 0, 0, 0, 0, 0, 0})));
  const Outcome stream = rig.run(command_frame(1, {4}));
  EXPECT_THAT(stream.lines,
              ElementsAre("process_message: 1", "get_raw error get_raw_data returned 22\n"));

  // What needs no sensor service is still served.
  const Outcome calibration = rig.run(command_frame(4, {3}));
  EXPECT_THAT(raw_frames(calibration),
              ElementsAre(frame_bytes(5, payload({3, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1}))));
  EXPECT_EQ(rig.sim.opened_connections(), 0);
  size_t opens = 0;
  for (const Line& l : rig.log()) opens += text_of(l) == "libsensor1: open -> 11" ? 1 : 0;
  EXPECT_EQ(opens, 50u);
}

TEST(FaultMatrix, FailedOpensThenAServiceGoneForGood) {
  Rig rig;
  rig.sim.refuse_opens(5, 10);
  rig.start();
  rig.wait_until_settled();
  Lines attempts;
  for (const std::string& l : thread_lines_from(rig, "diag_logging_start_thread start\n")) {
    if (starts_with(l, "libsensor1: open") || starts_with(l, "sensor1_open") ||
        starts_with(l, "get_handle_for_sensor")) {
      attempts.push_back(l);
    }
  }
  Lines expected;
  for (int i = 0; i < 10; ++i) {
    expected.push_back("libsensor1: open -> 5");
    expected.push_back("sensor1_open_or_reopen: sensor1_open() failed ret=5");
  }
  expected =
      expected + Lines({"libsensor1: open -> 0", "sensor1_open_or_reopen: sensor1_open success\n",
                        "get_handle_for_sensor: id:0\n"});
  EXPECT_EQ(attempts, expected);
  const Outcome served = rig.run(command_frame(8, {0}));
  EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));

  // The service goes away for good while the link is up. The success above gave the budget back
  // its 50 attempts; the first of the three reopen tries spends them, the other two try nothing.
  rig.sim.stop_listening();
  rig.sim.drop_connection();
  ASSERT_TRUE(rig.wait_for_text("rcv_test_msg hh_read_data_thread success\n", 10s))
      << rig.daemon->output();
  EXPECT_EQ(thread_lines_from(rig, "libsensor1: connection ended, BROKEN_PIPE"),
            Lines({"libsensor1: connection ended, BROKEN_PIPE",
                   "BROKEN_PIPE sensor1_handle <handle>\n", "libsensor1: close -> 0"}) +
                fifty_refused_opens() +
                Lines({"BROKEN_PIPE fail to open sensor1\n",
                       "rcv_test_msg read/update light coef efs file in broken pipe\n",
                       "rcv_test_msg hh_read_data_thread success\n"}));
  EXPECT_EQ(rig.tools.calls(), Lines({kStartTool, kStopTool})) << "logging stopped with the link";
  auto refresh = rig.kernel.receive_type(34, 10s);
  ASSERT_TRUE(refresh) << "a new refresh thread runs";
  EXPECT_EQ(refresh->raw, frame_bytes(34, {0x04, 0x01}));

  // Every later request fails at its allocation; the replies built from stored results still go
  // out, and the walk goes on.
  const Outcome status = rig.run(command_frame(0, {0}));
  EXPECT_THAT(status.lines,
              ElementsAre("process_message: 0", "[get_status]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_THAT(status.frames, IsEmpty());
  const Outcome selftest = rig.run(command_frame(8, {0}));
  EXPECT_THAT(selftest.lines,
              ElementsAre("process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
                          "[get_selftest_result]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_EQ(raw_frames(selftest), raw_frames(served));
  const Outcome malformed = rig.run(command_frame_bytes(0, {}, 100));
  EXPECT_THAT(malformed.lines, ElementsAre("process_message: malformed netlink message\n"));
  const Outcome calibration = rig.run(command_frame(4, {3}));
  EXPECT_EQ(calibration.frames.size(), 1u);

  // Not even a service that is back is tried again: the process stays without a connection.
  rig.sim.resume_listening();
  const Outcome later = rig.run(command_frame(0, {0}));
  EXPECT_THAT(later.lines,
              ElementsAre("process_message: 0", "[get_status]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_EQ(rig.sim.opened_connections(), 1);
  EXPECT_FALSE(rig.daemon->wait_exit(0ms));
}

TEST(FaultMatrix, TheLinkLostDuringASelfTestIsRebuilt) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();  // DIAG logging runs: the start-up thread has set its state to 1
  std::atomic<bool> dropped{false};
  rig.sim.set_request_hook([&](kestrel_sim::Simulator& sim, const kestrel_sim::Request& r) {
    if (r.header.msg_id == 13 && !dropped.exchange(true)) sim.drop_connection();
  });

  // The self test's request kills the link: its wait runs out and the reply is built from the
  // (still empty) stored results.
  const Outcome lost = rig.run(command_frame(8, {0}));
  EXPECT_EQ(lost.lines,
            Lines({"process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
                   "get_selftest_result: LSM6DSM ACCEL SELFTEST, TestType = (6)\n",
                   "get_selftest_result: msg_hdr.msg_id = 0xd, id = 0\n"}) +
                waited_in_vain("get_selftest_result"));
  EXPECT_THAT(raw_frames(lost), ElementsAre(accel_reply({0, 0, 0, 0, 0, 0, 0, 0})));

  // Meanwhile the callback thread stops DIAG logging, reopens, starts logging again and starts a
  // new refresh thread.
  ASSERT_TRUE(rig.wait_for_text("rcv_test_msg hh_read_data_thread success\n", 10s))
      << rig.daemon->output();
  EXPECT_EQ(
      thread_lines_from(rig, "libsensor1: connection ended, BROKEN_PIPE"),
      Lines({"libsensor1: connection ended, BROKEN_PIPE", "BROKEN_PIPE sensor1_handle <handle>\n",
             "libsensor1: close -> 0", "libsensor1: open -> 0",
             "sensor1_open_or_reopen: sensor1_open success\n", "get_handle_for_sensor: id:0\n",
             "BROKEN_PIPE success to open sensor1\n", "check_property Success\n",
             "check_files is not exist -1\n", "libdiag: Diag_LSM_Init ok",
             "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
             "libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 1",
             "libdiag: Diag_LSM_DeInit", "sns_set_diag_tx_mode: diag_mdlog Enter 1\n",
             "rcv_test_msg read/update light coef efs file in broken pipe\n",
             "rcv_test_msg hh_read_data_thread success\n"}));
  EXPECT_EQ(rig.tools.calls(), Lines({kStartTool, kStopTool, kStartTool}));
  auto refresh = rig.kernel.receive_type(34, 10s);
  ASSERT_TRUE(refresh) << "the second refresh frame";
  EXPECT_EQ(refresh->raw, frame_bytes(34, {0x04, 0x01}));
  EXPECT_EQ(rig.sim.current_connection(), 2);

  // The next command goes out on the new connection and is answered.
  const Outcome again = rig.run(command_frame(8, {0}));
  EXPECT_THAT(raw_frames(again), ElementsAre(accel_reply(kHealthyAccel)));
  std::vector<kestrel_sim::Request> requests = rig.sim.requests();
  ASSERT_EQ(requests.size(), 2u);
  EXPECT_EQ(requests[0].connection, 1);
  EXPECT_EQ(requests[1].connection, 2);
  EXPECT_EQ(requests[1].body, requests[0].body);
}

TEST(FaultMatrix, FaultyTrafficFromTheServiceIsLoggedAndPassedOver) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  auto expect_logged = [&](const std::string& line, int priority) {
    ASSERT_TRUE(rig.wait_for_text(line, 5s)) << rig.daemon->output();
    const std::vector<Line> log = rig.log();
    auto it =
        std::find_if(log.begin(), log.end(), [&](const Line& l) { return text_of(l) == line; });
    ASSERT_NE(it, log.end());
    EXPECT_EQ(it->priority, priority) << line;
    EXPECT_NE(it->tid, rig.daemon->pid()) << "on the library's thread: " << line;
  };

  // Link events and malformed callbacks.
  rig.sim.retry_open();
  expect_logged("\n received RETRY_OPEN!!!\n", 6);
  rig.sim.callback(7, true, true, Header{0, 5, 0, 0}, {1, 2});
  expect_logged("rcv_test_msg: Received unknown message type: 7", 5);
  rig.sim.callback(1, false, true, Header{0, 64, 0, 0}, {1, 2});
  expect_logged("rcv_test_msg: received NULL msg_hdr_ptr! type: 1", 6);

  // Responses that report an error, or are too short for what they carry.
  rig.sim.respond(Header{0, 11, 0, 6}, kestrel_sim::common_response_body(1, 4));
  expect_logged("rcv_test_msg: Response: 1, Error: 4", 6);
  rig.sim.respond(Header{0, 64, 0, 0}, std::vector<uint8_t>(10, 0));
  expect_logged("rcv_test_msg: type 1 service 0 msg_id 64 txn 0: body of 10 bytes, needs 196", 6);

  // Light-sensor data that is not valid still produces a frame, without new data.
  rig.sim.indicate(Header{44, 33, 0, 0},
                   kestrel_sim::daf_indication_body(61, 1, 20, {1, 2, 3, 4, 5, 6}));
  expect_logged(
      "[DAF]daf_test: Unexpected error when parsing DAF ALS & RGB Polling IndicationMsg! valid 1 "
      "len 20\n",
      6);
  auto daf = rig.kernel.receive_type(2, 5s);
  ASSERT_TRUE(daf);
  EXPECT_EQ(daf->raw, frame_bytes(2, std::vector<uint8_t>(16, 0)));
  rig.sim.indicate(Header{44, 33, 0, 0}, kestrel_sim::daf_indication_body(51, 0, 8, {}));
  expect_logged("[DAF]msgPtr->IndicationMsg_valid false", 6);
  daf = rig.kernel.receive_type(2, 5s);
  ASSERT_TRUE(daf);
  EXPECT_EQ(daf->raw, frame_bytes(2, std::vector<uint8_t>(16, 0)));
  // A sample of a sensor the daemon does not know: code -1, no values.
  rig.sim.indicate(Header{0, 3, 0, 0}, kestrel_sim::sample_indication_body(99, 0, 5, 6, 7));
  auto sample = rig.kernel.receive_type(2, 5s);
  ASSERT_TRUE(sample);
  EXPECT_EQ(sample->raw, frame_bytes(2, payload({-1, 0, 0, 0})));

  // Failed tests, answered by hand while the command waits.
  rig.sim.set_healthy(false);
  auto answer_next = [&](int32_t msg_id, const std::vector<uint8_t>& body) {
    auto r = rig.sim.next_request(5s);
    ASSERT_TRUE(r);
    ASSERT_EQ(r->header.msg_id, msg_id);
    rig.sim.indicate(Header{0, 13, 0, 4}, body);
  };
  // The fuse ROM read fails with an error code: its words and result 1 go to the kernel.
  rig.kernel.send(command_frame(11));
  answer_next(13, kestrel_sim::test_indication_body(20, 9, 5, 1, 3, {7, 8, 9}));
  auto fuse = rig.kernel.receive_type(11, 5s);
  ASSERT_TRUE(fuse);
  ASSERT_TRUE(rig.wait_for_text("rcv_complete: result - 1\n", 5s));
  EXPECT_EQ(fuse->raw, frame_bytes(11, payload({2, 7, 8, 9, 0, 0, 0, 0, 1})));
  EXPECT_EQ(
      thread_lines_from(rig, "rcv_test_msg, SensorID:20, TestType:9"),
      Lines({"rcv_test_msg, SensorID:20, TestType:9",
             "rcv_test_msg: Received error in IND message: 3", "rcv_complete: result - 1\n"}));
  // The magnetometer self test fails without a code: word 0 becomes -1, the status stays -1.
  rig.kernel.send(command_frame(8, {2}));
  answer_next(13, kestrel_sim::test_indication_body(20, 6, 5, 0, 0, {1, 2, 3}));
  auto mag = rig.kernel.receive_type(9, 5s);
  ASSERT_TRUE(mag);
  EXPECT_EQ(words_of(*mag),
            std::vector<int32_t>({2, -1, 2, 0, 0, 0, 0, 0, 0, 3, 0, 0, 0, 0, 0, 0, 0, 0}));
  ASSERT_TRUE(rig.sim.next_request(5s)) << "the calibration reset after the magnetometer test";
  ASSERT_TRUE(rig.wait_for_text("rcv_complete: result - -1\n", 5s));
  EXPECT_EQ(count_prefix(thread_lines_from(rig, "rcv_test_msg, SensorID:20, TestType:6"),
                         "rcv_test_msg: Message indicates error w/o code (-1)"),
            1u);
  // An indication of a sensor the daemon does not know still ends the wait.
  rig.kernel.send(command_frame(0, {3}));
  answer_next(11, kestrel_sim::test_indication_body(50, 3, 0, 0, 0, {}));
  auto status = rig.kernel.receive_type(0, 5s);
  ASSERT_TRUE(status);
  EXPECT_EQ(status->raw, frame_bytes(0, {3, 0}));
  expect_logged("rcv_test_msg: wrong SensorID 50", 6);

  // A result that nobody asked for is taken by the next wait, at once.
  const size_t completed = rig.daemon->count("rcv_complete: result - 0\n");
  rig.sim.indicate(Header{0, 13, 0, 4},
                   kestrel_sim::test_indication_body(0, 6, 0, 0, 0, {1, 2, 3, 4, 5, 6, 7, 8}));
  ASSERT_TRUE(rig.wait_for_text("rcv_complete: result - 0\n", 5s, completed + 1));
  const Outcome stale = rig.run(command_frame(8, {0}));
  EXPECT_EQ(stale.lines,
            Lines({"process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
                   "get_selftest_result: LSM6DSM ACCEL SELFTEST, TestType = (6)\n",
                   "get_selftest_result: msg_hdr.msg_id = 0xd, id = 0\n",
                   "waiting for response IN - timeout=8000",
                   "wait_for_response: cb has arrived without waiting",
                   "wait_for_response: response received."}));
  EXPECT_THAT(raw_frames(stale), ElementsAre(accel_reply({1, 2, 3, 4, 5, 6, 7, 8})));

  // All through the same connection, and it still serves.
  rig.sim.set_healthy(true);
  rig.sim.clear_requests();
  const Outcome served = rig.run(command_frame(8, {0}));
  EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));
  EXPECT_EQ(rig.sim.opened_connections(), 1);
  EXPECT_EQ(rig.sim.current_connection(), 1);
}

TEST(FaultMatrix, CommandsWithoutAnAnswerReplyFromWhatIsStored) {
  Rig rig(false);
  rig.start();
  rig.wait_until_settled();
  const Outcome status = rig.run(command_frame(0, {1}));
  EXPECT_EQ(status.lines, Lines({"process_message: 0"}) + waited_in_vain("get_status"));
  EXPECT_THAT(raw_frames(status), ElementsAre(frame_bytes(0, {1, 1})));

  const Outcome store = rig.run(command_frame(6, {4, 0}));
  EXPECT_EQ(store.lines, Lines({"process_message: 6", "store_calib_data: Enter\n",
                                "store_calib_data: sensor_type = 4 \n", "store_calib_data: CAL(0)",
                                "store_calib_data: SensorID:40, DataType:0"}) +
                             waited_in_vain("store_calib_data"));
  EXPECT_THAT(raw_frames(store), ElementsAre(frame_bytes(7, payload({5, 1}))));

  const Outcome fuse = rig.run(command_frame(11));
  EXPECT_EQ(fuse.lines.back(),
            "get_mag_register_data: id == ADSP_FACTORY_MAG_READ_FUSE_ROM, result(-1)");
  EXPECT_THAT(raw_frames(fuse),
              ElementsAre(frame_bytes(11, payload({2, 0, 0, 0, 0, 0, 0, 0, -1}))));

  const Outcome temperature = rig.run(command_frame(10));
  EXPECT_EQ(temperature.lines.back(), "send_gyro_selftest_result: wrong test type 0\n");
  EXPECT_THAT(temperature.frames, IsEmpty());

  const Outcome lpf = rig.run(command_frame(15));
  EXPECT_EQ(Lines(lpf.lines.end() - 5, lpf.lines.end()),
            waited_in_vain("set_accel_lpf") +
                Lines({"send_accel_lpf_result OUT: test type = 0, lpf_on_off = 0\n"}));
  EXPECT_THAT(lpf.frames, IsEmpty());

  const Outcome pressure = rig.run(command_frame(8, {3}));
  EXPECT_EQ(Lines(pressure.lines.end() - 4, pressure.lines.end()),
            waited_in_vain("get_selftest_result"));
  EXPECT_THAT(words_of(pressure.frames.at(0)),
              ElementsAreArray(
                  std::vector<int32_t>({3, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0})));
  rig.sim.set_healthy(true);
  const Outcome served = rig.run(command_frame(8, {0}));
  EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));
}

TEST(FaultMatrix, RegistryFailuresStillGiveOneReport) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  const auto open_lines = [](const std::vector<int>& results) {
    Lines out;
    int count = 50;
    for (int r : results) {
      out.push_back("libsensor_reg: open -> " + std::to_string(r));
      out.push_back("Inside While " + std::to_string(r) + ", count " + std::to_string(count--));
    }
    out.push_back("Outside While " + std::to_string(results.back()));
    return out;
  };

  // Two failed opens, then the registry opens and is read.
  write_file(test_registry_path(), "0 = 05\n1 = 00\n2 = 07\nopen_failures = 2\n");
  const Outcome twice = rig.run(command_frame(4, {0}));
  EXPECT_EQ(twice.lines,
            Lines({"process_message: 4", "read_calib_data: sensor_type 0\n"}) +
                open_lines({-1, -1, 0}) +
                Lines({"libsensor_reg: read 0 -> 0 len 1", "libsensor_reg: read 1 -> 0 len 1",
                       "libsensor_reg: read 2 -> 0 len 1",
                       "read_calib_data: ID=0, Type=0, Result=1, Val=5,0,7",
                       "libsensor_reg: close -> 0"}));
  EXPECT_THAT(raw_frames(twice),
              ElementsAre(frame_bytes(5, payload({0, 5, 0, 7, 0, 0, 0, 0, 0, 0, 1}))));

  // It never opens: fifty attempts, the reads are made all the same and fail.
  write_file(test_registry_path(), "0 = 05\n1 = 00\n2 = 07\nopen_failures = 50\n");
  const Outcome never = rig.run(command_frame(4, {0}));
  EXPECT_EQ(never.lines,
            Lines({"process_message: 4", "read_calib_data: sensor_type 0\n"}) +
                open_lines(std::vector<int>(50, -1)) +
                Lines({"libsensor_reg: read 0 -> -1 len 0", "libsensor_reg: read 1 -> -1 len 0",
                       "libsensor_reg: read 2 -> -1 len 0",
                       "read_calib_data: ID=0, Type=0, Result=-1, Val=0,0,0",
                       "libsensor_reg: close -> 0"}));
  EXPECT_THAT(raw_frames(never),
              ElementsAre(frame_bytes(5, payload({0, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1}))));

  // One read of the light sensor's items fails: words 0 to 2 are cleared, the others kept.
  write_file(test_registry_path(),
             "102 = 01\n119 = 02\n120 = 03\n123 = 04\nread_error 124 = 5\n125 = 06\n126 = 07\n");
  const Outcome read_error = rig.run(command_frame(4, {4}));
  EXPECT_EQ(read_error.lines,
            Lines({"process_message: 4", "read_calib_data: sensor_type 5\n"}) + open_lines({0}) +
                Lines({"libsensor_reg: read 102 -> 0 len 1", "libsensor_reg: read 119 -> 0 len 1",
                       "libsensor_reg: read 120 -> 0 len 1", "libsensor_reg: read 123 -> 0 len 1",
                       "libsensor_reg: read 124 -> 5 len 0", "libsensor_reg: read 125 -> 0 len 1",
                       "libsensor_reg: read 126 -> 0 len 1", "pdata.trim 0",
                       "read_calib_data: ID=40, Type=5, Result=-1, Val=0,0,0",
                       "libsensor_reg: close -> 0"}));
  EXPECT_THAT(raw_frames(read_error),
              ElementsAre(frame_bytes(5, payload({5, 0, 0, 0, 4, 0, 7, 6, 0, 0, -1}))));

  // The close fails after the report has gone out.
  write_file(test_registry_path(), "300 = 01\n301 = 02\n302 = 03\nclose_result = 7\n");
  const Outcome close_error = rig.run(command_frame(4, {1}));
  EXPECT_EQ(
      close_error.lines,
      Lines({"process_message: 4", "read_calib_data: sensor_type 1\n"}) + open_lines({0}) +
          Lines({"libsensor_reg: read 300 -> 0 len 1", "libsensor_reg: read 301 -> 0 len 1",
                 "libsensor_reg: read 302 -> 0 len 1",
                 "read_calib_data: ID=10, Type=1, Result=0, Val=1,2,3", "libsensor_reg: close -> 7",
                 "read_calib_data: Error in sensor_reg_close(): 7"}));
  EXPECT_THAT(raw_frames(close_error),
              ElementsAre(frame_bytes(5, payload({1, 1, 2, 3, 0, 0, 0, 0, 0, 0, 0}))));
  remove_file(test_registry_path());

  const Outcome served = rig.run(command_frame(8, {0}));
  EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));
}

TEST(FaultMatrix, DiagFailuresKeepLoggingOffAndTheDaemonServing) {
  const Lines opened = {"libsensor1: open -> 0", "sensor1_open_or_reopen: sensor1_open success\n",
                        "get_handle_for_sensor: id:0\n"};
  const Lines checks = {"check_property Success\n", "check_files is not exist -1\n"};
  struct Case {
    const char* name;
    DaemonEnv env;
    bool uart_directory;  // the UART selection file cannot be read
    Lines decision;       // from the DIAG checks to the end of the start attempt
  };
  const Case cases[] = {
      {"libdiag cannot be initialised",
       {{"KESTREL_DIAG_INIT", "fail"}},
       false,
       checks + Lines({"libdiag: Diag_LSM_Init fail", "sns_set_diag_mode: Diag_LSM_Init failed\n",
                       "libdiag: Diag_LSM_DeInit",
                       "sns_set_diag_tx_mode: sns_set_diag_mode result: -1\n"})},
      {"the buffering mode is refused",
       {{"KESTREL_DIAG_TX_MODE_RESULT", "0"}},
       false,
       checks + Lines({"libdiag: Diag_LSM_Init ok",
                       "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
                       "libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 0",
                       "sns_set_diag_mode: Failed configuring the peripheral tx_mode, result: 0\n",
                       "libdiag: Diag_LSM_DeInit",
                       "sns_set_diag_tx_mode: sns_set_diag_mode result: 0\n"})},
      {"the UART selection cannot be read",
       {},
       true,
       {"check_property Success\n", "check_files read fails",
        "sns_set_diag_tx_mode: DM mode is setting\n"}},
  };
  const std::string uart = test_sysroot() + "/data/misc/radio/uart.txt";
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    if (c.uart_directory) {
      write_file(uart + "/keep", "");
      remove_file(uart + "/keep");
    }
    Rig rig;
    rig.start(c.env);
    rig.wait_until_settled();
    EXPECT_EQ(thread_lines_from(rig, "diag_logging_start_thread start\n"),
              Lines({"diag_logging_start_thread start\n"}) + opened + c.decision);

    // Logging is off: a dump finds nothing to dump, the sensor states are still asked for.
    const Outcome dump = rig.run(command_frame(27, {0, 0}));
    EXPECT_THAT(dump.lines, ElementsAre("process_message: 27", "diag : Diabled Logging System\n"));
    auto states = rig.sim.next_request(5s);
    ASSERT_TRUE(states);
    EXPECT_EQ(states->header.msg_id, 64);

    // After a broken link the same decision is made again, with the same outcome.
    rig.sim.drop_connection();
    ASSERT_TRUE(rig.wait_for_text("rcv_test_msg hh_read_data_thread success\n", 10s));
    EXPECT_EQ(thread_lines_from(rig, "libsensor1: connection ended, BROKEN_PIPE"),
              Lines({"libsensor1: connection ended, BROKEN_PIPE",
                     "BROKEN_PIPE sensor1_handle <handle>\n", "libsensor1: close -> 0"}) +
                  opened + Lines({"BROKEN_PIPE success to open sensor1\n"}) + c.decision +
                  Lines({"rcv_test_msg read/update light coef efs file in broken pipe\n",
                         "rcv_test_msg hh_read_data_thread success\n"}));
    EXPECT_THAT(rig.tools.calls(), IsEmpty()) << "the tool was neither started nor stopped";
    const Outcome served = rig.run(command_frame(8, {0}));
    EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));
    if (c.uart_directory) rmdir(uart.c_str());
  }
}

TEST(FaultMatrix, AFloodOfDatagramsWhileASelfTestWaitsIsWalkedInOrderAfterwards) {
  Rig rig(false);
  // The self test's wait must outlast the sending of the flood: 8 s scaled to 0.8 s.
  rig.start({{"KESTREL_TIME_SCALE", "0.1"}});
  rig.wait_until_settled();
  const std::vector<int32_t> words = {1, 2, 3, 4, 5, 6, 7, 8};
  uint16_t next = 2000;
  auto walked = [&](uint16_t first, uint16_t end) {
    Lines out;
    for (const std::string& l : rig.lines_of_thread(rig.daemon->pid())) {
      if (!starts_with(l, "process_message: ")) continue;
      const int n = atoi(l.c_str() + strlen("process_message: "));
      if (n >= first && n < end) out.push_back(l);
    }
    return out;
  };
  auto expected_walk = [](uint16_t first, uint16_t end) {
    Lines out;
    for (int n = first; n < end; ++n) out.push_back("process_message: " + std::to_string(n));
    return out;
  };

  // A sender that does not wait: the datagrams queue on the daemon's socket until its buffer is
  // full; the next ones are refused to the sender (EAGAIN) and never reach the daemon.
  ASSERT_TRUE(rig.kernel.send(command_frame(8, {0})));
  ASSERT_TRUE(rig.sim.next_request(5s)) << "the self test waits";
  const uint16_t first = next;
  int refused_errno = 0;
  struct sockaddr_nl to = {};
  to.nl_family = AF_NETLINK;
  to.nl_pid = 20000;
  while (next < first + 5000) {
    const std::vector<uint8_t> d = command_frame(next);
    if (sendto(rig.kernel.fd(), d.data(), d.size(), MSG_DONTWAIT,
               reinterpret_cast<struct sockaddr*>(&to), sizeof to) < 0) {
      refused_errno = errno;
      break;
    }
    ++next;
  }
  const int queued = next - first;
  std::cout << "[ observed ] " << queued << " datagrams of 16 bytes queued while the self test "
            << "waited; the next one was refused with errno " << refused_errno << "\n";
  EXPECT_EQ(refused_errno, EAGAIN);
  EXPECT_GT(queued, 0);
  rig.sim.indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(0, 6, 0, 0, 0, words));
  auto reply = rig.kernel.receive_type(9, 10s);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->raw, accel_reply(words));
  rig.run(command_frame(4, {3}));
  EXPECT_EQ(walked(first, next), expected_walk(first, next));

  // A sender that waits: it blocks while the buffer is full and goes on once the daemon reads
  // again, so every datagram arrives.
  ASSERT_TRUE(rig.kernel.send(command_frame(8, {0})));
  ASSERT_TRUE(rig.sim.next_request(5s));
  const uint16_t second = next;
  const int total = 3 * queued;
  std::atomic<int> sent{0};
  std::atomic<bool> finished{false};
  std::thread sender([&] {
    for (int i = 0; i < total; ++i) {
      if (!rig.kernel.send(command_frame(static_cast<uint16_t>(second + i)))) break;
      ++sent;
    }
    finished = true;
  });
  // Once as many as fit are queued, the sender waits for the daemon.
  while (sent < queued && !finished) std::this_thread::sleep_for(1ms);
  rig.sim.indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(0, 6, 0, 0, 0, words));
  sender.join();
  EXPECT_EQ(sent, total);
  next = static_cast<uint16_t>(second + total);
  reply = rig.kernel.receive_type(9, 10s);
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->raw, accel_reply(words));
  const Outcome after = rig.run(command_frame(4, {3}));
  EXPECT_EQ(after.frames.size(), 1u) << "the daemon still answers";
  EXPECT_EQ(walked(second, next), expected_walk(second, next));
  for (const std::string& l : rig.lines_of_thread(rig.daemon->pid())) {
    EXPECT_FALSE(starts_with(l, "main: recvfrom(netlink)")) << "no receive failed";
  }
}

TEST(FaultMatrix, FramesToAnAbsentKernelAreLostWithoutATrace) {
  kestrel_sim::Simulator sim(test_socket_path(), true);
  FakeTools tools;
  std::optional<KernelPeer> kernel;
  kernel.emplace(100);
  DaemonProcess daemon({}, tools.dir());
  ASSERT_TRUE(daemon.wait_for("main: do while start = 0\n", 10s));
  ASSERT_TRUE(kernel->receive_type(34, 10s));

  // Nobody holds the kernel's port: the report cannot be delivered. The commands come from
  // another port id; the daemon takes datagrams from any sender.
  kernel.reset();
  KernelPeer other(101);
  ASSERT_TRUE(other.send(command_frame(4, {3})));
  ASSERT_TRUE(other.send(command_frame(1001)));
  ASSERT_TRUE(daemon.wait_for("process_message: 1001", 10s));
  const Lines main = thread_texts(parse_log(daemon.output()), daemon.pid());
  auto walk = std::find(main.begin(), main.end(), "process_message: 4");
  auto marker = std::find(walk, main.end(), "process_message: 1001");
  ASSERT_NE(marker, main.end());
  EXPECT_EQ(
      Lines(walk, marker + 1),
      Lines({"process_message: 4", "read_calib_data: sensor_type 3\n", "libsensor_reg: open -> 0",
             "Inside While 0, count 50", "Outside While 0",
             "read_calib_data: ID=30, Type=3, Result=-1, Val=0,0,0", "libsensor_reg: close -> 0",
             "main: do while start = 20\n", "left = 16", "process_message: 1001"}));

  // Once the port is held again, the next report arrives, and only that one.
  kernel.emplace(100);
  ASSERT_TRUE(kernel->send(command_frame(4, {0})));
  auto report = kernel->receive(10s);
  ASSERT_TRUE(report);
  EXPECT_EQ(report->raw, frame_bytes(5, payload({0, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1})));
  EXPECT_FALSE(daemon.wait_exit(0ms));
}

TEST(FaultMatrix, MalformedCommandsAreRefusedAndTheWalkGoesOn) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  // A frame longer than the datagram: the rest of the datagram is dropped.
  EXPECT_THAT(rig.run(command_frame_bytes(0, {0, 0, 0, 0}, 64)).lines,
              ElementsAre("process_message: malformed netlink message\n"));
  // A frame too short for its command's fields.
  EXPECT_THAT(rig.run(command_frame_bytes(8, {})).lines,
              ElementsAre("process_message: 8",
                          "process_message: NETLINK_MESSAGE_SELFTEST refused: frame of 16 bytes, "
                          "needs 20"));
  // Bulk data longer than the request can carry.
  EXPECT_THAT(rig.run(command_frame(22, {4, 300})).lines,
              ElementsAre("process_message: 22",
                          "send_bigdata: command 22 refused: data length 300 (frame carries 0 "
                          "bytes, at most 256)"));
  // A register dump of a sensor without registers.
  EXPECT_THAT(rig.run(command_frame(19, {6})).lines,
              ElementsAre("process_message: 19",
                          "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type error"));
  EXPECT_THAT(rig.sim.requests(), IsEmpty()) << "nothing reached the sensor service";
  const Outcome served = rig.run(command_frame(8, {0}));
  EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));
}

}  // namespace
