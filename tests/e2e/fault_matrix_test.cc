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
#include <functional>
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
using ::testing::IsEmpty;

const char kStartTool[] =
    "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c";
const char kStopTool[] = "diag_mdlog -k -p 16";
const char kBrokenPipe[] = "libsensor1: connection ended, BROKEN_PIPE";
const char kRefreshed[] = "rcv_test_msg hh_read_data_thread success\n";
const Lines kLinkEnded = {kBrokenPipe, "BROKEN_PIPE sensor1_handle <handle>\n",
                          "libsensor1: close -> 0"};
const Lines kOpened = {"libsensor1: open -> 0", "sensor1_open_or_reopen: sensor1_open success\n",
                       "get_handle_for_sensor: id:0\n"};
const Lines kRefreshThread = {"rcv_test_msg read/update light coef efs file in broken pipe\n",
                              kRefreshed};
// The healthy phone's accelerometer self test.
const std::vector<int32_t> kHealthyAccel = {1, 12, -8, 1003, 1, 310, -295, 380};

std::string would_block(int retry) {
  return "sensor1_open_or_reopen: sensor1_open returned EWOULDBLOCK.Daemon not ready, will try "
         "again (retry = " +
         std::to_string(retry) + ")";
}

// The attempts of one exhausted open budget, as the thread that makes them logs them.
Lines fifty_refused_opens() {
  Lines out;
  for (int retry = 50; retry >= 1; --retry)
    out = out + Lines{"libsensor1: open -> 11", would_block(retry)};
  return out;
}

// The lines of a thread that start with one of the prefixes.
Lines only(const Lines& lines, const Lines& prefixes) {
  Lines out;
  for (const std::string& l : lines) {
    for (const std::string& p : prefixes) {
      if (starts_with(l, p)) {
        out.push_back(l);
        break;
      }
    }
  }
  return out;
}

// A wait on the command waiter that ran out.
Lines waited_in_vain(const std::string& requester) {
  return {"waiting for response IN - timeout=8000",
          "wait_for_response: pthread_cond_timedwait() rc=110",
          "wait_for_response: response received.", requester + ": ERROR: No response for command"};
}

const Lines kSelfTestSent = {"process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
                             "get_selftest_result: LSM6DSM ACCEL SELFTEST, TestType = (6)\n",
                             "get_selftest_result: msg_hdr.msg_id = 0xd, id = 0\n"};

// Without a connection the requests get the empty handle and fail at their allocation (22); the
// self test still replies from the stored results, whose frame is returned.
Bytes expect_empty_handle(Rig& rig) {
  const Outcome status = rig.run(build_command(0, {0}));
  EXPECT_THAT(status.lines,
              ElementsAre("process_message: 0", "[get_status]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_THAT(status.frames, IsEmpty());
  const Outcome selftest = rig.run(build_command(8, {0}));
  EXPECT_THAT(selftest.lines,
              ElementsAre("process_message: 8", "get_selftest_result: sensor_type = 0, id = 0\n",
                          "[get_selftest_result]sensor1_alloc_msg_buf error - 22\n"));
  EXPECT_EQ(selftest.frames.size(), 1u);
  return selftest.frames.empty() ? Bytes() : selftest.frames[0].raw;
}

void expect_served(Rig& rig) {
  EXPECT_THAT(raw_frames(rig.run(build_command(8, {0}))), ElementsAre(accel_reply(kHealthyAccel)));
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

TEST(FaultMatrix, StartUpFailuresEndTheProcessWithTheirStatus) {
  int held = -1;                       // the guard port, held by the test
  std::optional<KernelPort> squatter;  // the netlink port id, held by the test
  const Lines before_channel = {"Factory Daemon Start!", "Factory Daemon Start! 2",
                                "Factory Daemon Start! 3", "Factory Daemon Start! 4", "main\n"};
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
       1,
       {"Factory Daemon Start!", "Program is already running... can't run second instance!!!"}},
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
      ASSERT_TRUE(rig.wait_for_text(c.messages.back(), 5s)) << rig.daemon->output();
      EXPECT_EQ(rig.daemon->messages(), c.messages);
      EXPECT_EQ(rig.sim.opened_connections(), 0) << "no start-up thread opened the service";
    }
    squatter.reset();
    if (held >= 0) close(held);
    held = -1;
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
  EXPECT_EQ(only(rig.thread_lines_from("diag_logging_start_thread start\n"),
                 {"libsensor1: open", "sensor1_open_or_reopen"}),
            fifty_refused_opens());

  // The budget is spent: the requests fail at their allocation, without a new attempt, although
  // the service would now accept.
  EXPECT_EQ(expect_empty_handle(rig), accel_reply({0, 0, 0, 0, 0, 0, 0, 0}));
  EXPECT_THAT(rig.run(build_command(1, {4})).lines,
              ElementsAre("process_message: 1", "get_raw error get_raw_data returned 22\n"));
  // What needs no sensor service is still served.
  EXPECT_THAT(raw_frames(rig.run(build_command(4, {3}))),
              ElementsAre(frame_bytes(5, payload({3, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1}))));
  EXPECT_EQ(rig.sim.opened_connections(), 0);
  EXPECT_EQ(rig.count_text("libsensor1: open -> 11"), 50u);
}

TEST(FaultMatrix, FailedOpensThenAServiceGoneForGood) {
  Rig rig;
  rig.sim.refuse_opens(5, 10);
  rig.start();
  rig.wait_until_settled();
  Lines refused;
  for (int i = 0; i < 10; ++i) {
    refused = refused +
              Lines{"libsensor1: open -> 5", "sensor1_open_or_reopen: sensor1_open() failed ret=5"};
  }
  EXPECT_EQ(only(rig.thread_lines_from("diag_logging_start_thread start\n"),
                 {"libsensor1: open", "sensor1_open", "get_handle_for_sensor"}),
            refused + kOpened);
  const Outcome served = rig.run(build_command(8, {0}));
  EXPECT_THAT(raw_frames(served), ElementsAre(accel_reply(kHealthyAccel)));

  // The service goes away for good while the link is up. The success above gave the budget back
  // its 50 attempts; the first of the three reopen tries spends them, the other two try nothing.
  rig.sim.stop_listening();
  rig.sim.drop_connection();
  ASSERT_TRUE(rig.wait_for_text(kRefreshed, 10s)) << rig.daemon->output();
  EXPECT_EQ(rig.thread_lines_from(kBrokenPipe), kLinkEnded + fifty_refused_opens() +
                                                    Lines{"BROKEN_PIPE fail to open sensor1\n"} +
                                                    kRefreshThread);
  EXPECT_EQ(rig.tools.calls(), Lines({kStartTool, kStopTool})) << "logging stopped with the link";
  auto refresh = rig.kernel.next_frame_of_type(34, 10s);
  ASSERT_TRUE(refresh) << "a new refresh thread runs";
  EXPECT_EQ(refresh->raw, frame_bytes(34, {0x04, 0x01}));

  // Every later request fails at its allocation; the replies built from stored results still go
  // out, and the walk goes on.
  EXPECT_EQ(expect_empty_handle(rig), served.frames.at(0).raw);
  EXPECT_THAT(rig.run(build_frame(0, {}, 100)).lines,
              ElementsAre("process_message: malformed netlink message\n"));
  EXPECT_EQ(rig.run(build_command(4, {3})).frames.size(), 1u);
  // Not even a service that is back is tried again: the process stays without a connection.
  rig.sim.resume_listening();
  expect_empty_handle(rig);
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
  const Outcome lost = rig.run(build_command(8, {0}));
  EXPECT_EQ(lost.lines, kSelfTestSent + waited_in_vain("get_selftest_result"));
  EXPECT_THAT(raw_frames(lost), ElementsAre(accel_reply({0, 0, 0, 0, 0, 0, 0, 0})));

  // Meanwhile the callback thread stops DIAG logging, reopens, starts logging again and starts a
  // new refresh thread.
  ASSERT_TRUE(rig.wait_for_text(kRefreshed, 10s)) << rig.daemon->output();
  EXPECT_EQ(rig.thread_lines_from(kBrokenPipe),
            kLinkEnded + kOpened +
                Lines({"BROKEN_PIPE success to open sensor1\n", "check_property Success\n",
                       "check_files is not exist -1\n", "libdiag: Diag_LSM_Init ok",
                       "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
                       "libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 1",
                       "libdiag: Diag_LSM_DeInit", "sns_set_diag_tx_mode: diag_mdlog Enter 1\n"}) +
                kRefreshThread);
  EXPECT_EQ(rig.tools.calls(), Lines({kStartTool, kStopTool, kStartTool}));
  auto refresh = rig.kernel.next_frame_of_type(34, 10s);
  ASSERT_TRUE(refresh) << "the second refresh frame";
  EXPECT_EQ(refresh->raw, frame_bytes(34, {0x04, 0x01}));

  // The next command goes out on the new connection, with the same request, and is answered.
  expect_served(rig);
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
    for (const Line& l : rig.log()) {
      if (text_of(l) != line) continue;
      EXPECT_EQ(l.priority, priority) << line;
      EXPECT_NE(l.tid, rig.daemon->pid()) << "on the library's thread: " << line;
      return;
    }
  };
  auto expect_frame = [&](uint16_t type, const Bytes& body) {
    auto f = rig.kernel.next_frame_of_type(type, 5s);
    ASSERT_TRUE(f);
    EXPECT_EQ(f->raw, frame_bytes(type, body));
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
  rig.sim.respond(Header{0, 64, 0, 0}, Bytes(10, 0));
  expect_logged(
      "rcv_test_msg: type 1 service 0 msg_id 64 txn 0: body of 10 bytes, its log lines need 194",
      6);

  // Light-sensor data that is not valid still produces a frame, without new data.
  rig.sim.indicate(Header{44, 33, 0, 0},
                   kestrel_sim::daf_indication_body(61, 1, 20, {1, 2, 3, 4, 5, 6}));
  expect_logged(
      "[DAF]daf_test: Unexpected error when parsing DAF ALS & RGB Polling "
      "IndicationMsg! valid 1 len 20\n",
      6);
  expect_frame(2, Bytes(16, 0));
  rig.sim.indicate(Header{44, 33, 0, 0}, kestrel_sim::daf_indication_body(51, 0, 8, {}));
  expect_logged("[DAF]msgPtr->IndicationMsg_valid false", 6);
  expect_frame(2, Bytes(16, 0));
  // A sample of a sensor the daemon does not know: code -1, no values.
  rig.sim.indicate(Header{0, 3, 0, 0}, kestrel_sim::sample_indication_body(99, 0, 5, 6, 7));
  expect_frame(2, payload({-1, 0, 0, 0}));

  // Failed tests, answered by hand while the command waits.
  rig.sim.set_healthy(false);
  auto answer_next = [&](const Bytes& command, int32_t msg_id, const Bytes& body) {
    rig.kernel.send(command);
    auto r = rig.sim.next_request(5s);
    ASSERT_TRUE(r);
    ASSERT_EQ(r->header.msg_id, msg_id);
    rig.sim.indicate(Header{0, 13, 0, 4}, body);
  };
  // The fuse ROM read fails with an error code: its words and result 1 go to the kernel.
  answer_next(build_command(11), 13, kestrel_sim::test_indication_body(20, 9, 5, 1, 3, {7, 8, 9}));
  expect_frame(11, payload({2, 7, 8, 9, 0, 0, 0, 0, 1}));
  ASSERT_TRUE(rig.wait_for_text("rcv_complete: result - 1\n", 5s));
  EXPECT_EQ(
      rig.thread_lines_from("rcv_test_msg, SensorID:20, TestType:9"),
      Lines({"rcv_test_msg, SensorID:20, TestType:9",
             "rcv_test_msg: Received error in IND message: 3", "rcv_complete: result - 1\n"}));
  // The magnetometer self test fails without a code: word 0 becomes -1, the status stays -1.
  answer_next(build_command(8, {2}), 13,
              kestrel_sim::test_indication_body(20, 6, 5, 0, 0, {1, 2, 3}));
  expect_frame(9, payload({2, -1, 2, 0, 0, 0, 0, 0, 0, 3, 0, 0, 0, 0, 0, 0, 0, 0}));
  ASSERT_TRUE(rig.sim.next_request(5s)) << "the calibration reset after the magnetometer test";
  ASSERT_TRUE(rig.wait_for_text("rcv_complete: result - -1\n", 5s));
  EXPECT_EQ(only(rig.thread_lines_from("rcv_test_msg, SensorID:20, TestType:6"),
                 {"rcv_test_msg: Message indicates error w/o code (-1)"})
                .size(),
            1u);
  // An indication of a sensor the daemon does not know still ends the wait.
  answer_next(build_command(0, {3}), 11, kestrel_sim::test_indication_body(50, 3, 0, 0, 0, {}));
  expect_frame(0, {3, 0});
  expect_logged("rcv_test_msg: wrong SensorID 50", 6);

  // A result that nobody asked for is taken by the next wait, at once.
  const size_t completed = rig.count_text("rcv_complete: result - 0\n");
  rig.sim.indicate(Header{0, 13, 0, 4},
                   kestrel_sim::test_indication_body(0, 6, 0, 0, 0, {1, 2, 3, 4, 5, 6, 7, 8}));
  ASSERT_TRUE(rig.wait_for_text("rcv_complete: result - 0\n", 5s, completed + 1));
  const Outcome stale = rig.run(build_command(8, {0}));
  EXPECT_EQ(stale.lines, kSelfTestSent + Lines({"waiting for response IN - timeout=8000",
                                                "wait_for_response: cb has arrived without waiting",
                                                "wait_for_response: response received."}));
  EXPECT_THAT(raw_frames(stale), ElementsAre(accel_reply({1, 2, 3, 4, 5, 6, 7, 8})));

  // All through the same connection, and it still serves.
  rig.sim.set_healthy(true);
  expect_served(rig);
  EXPECT_EQ(rig.sim.opened_connections(), 1);
  EXPECT_EQ(rig.sim.current_connection(), 1);
}

TEST(FaultMatrix, CommandsWithoutAnAnswerReplyFromWhatIsStored) {
  Rig rig(false);
  rig.start();
  rig.wait_until_settled();
  const Outcome status = rig.run(build_command(0, {1}));
  EXPECT_EQ(status.lines, Lines{"process_message: 0"} + waited_in_vain("get_status"));
  EXPECT_THAT(raw_frames(status), ElementsAre(frame_bytes(0, {1, 1})));
  const Outcome store = rig.run(build_command(6, {4, 0}));
  EXPECT_EQ(store.lines, Lines({"process_message: 6", "store_calib_data: Enter\n",
                                "store_calib_data: sensor_type = 4 \n", "store_calib_data: CAL(0)",
                                "store_calib_data: SensorID:40, DataType:0"}) +
                             waited_in_vain("store_calib_data"));
  EXPECT_THAT(raw_frames(store), ElementsAre(frame_bytes(7, payload({5, 1}))));

  // The ends of the walks of the fuse-ROM read, the gyroscope temperature, the LPF and the
  // pressure self test, and what they send.
  struct Case {
    Bytes command;
    Lines last_lines;
    std::vector<Bytes> frames;
  };
  const Case cases[] = {
      {build_command(11),
       {"get_mag_register_data: id == ADSP_FACTORY_MAG_READ_FUSE_ROM, result(-1)"},
       {frame_bytes(11, payload({2, 0, 0, 0, 0, 0, 0, 0, -1}))}},
      {build_command(10), {"send_gyro_selftest_result: wrong test type 0\n"}, {}},
      {build_command(15),
       waited_in_vain("set_accel_lpf") +
           Lines{"send_accel_lpf_result OUT: test type = 0, lpf_on_off = 0\n"},
       {}},
      {build_command(8, {3}),
       waited_in_vain("get_selftest_result"),
       {frame_bytes(9, payload({3, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0}))}},
  };
  for (const Case& c : cases) {
    const Outcome o = rig.run(c.command);
    ASSERT_GE(o.lines.size(), c.last_lines.size());
    EXPECT_EQ(Lines(o.lines.end() - c.last_lines.size(), o.lines.end()), c.last_lines);
    EXPECT_EQ(raw_frames(o), c.frames);
  }
  rig.sim.set_healthy(true);
  expect_served(rig);
}

TEST(FaultMatrix, RegistryFailuresStillGiveOneReport) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  const auto open_lines = [](const std::vector<int>& results) {
    Lines out;
    int count = 50;
    for (int r : results) {
      out = out + Lines{"libsensor_reg: open -> " + std::to_string(r),
                        "Inside While " + std::to_string(r) + ", count " + std::to_string(count--)};
    }
    return out + Lines{"Outside While " + std::to_string(results.back())};
  };
  const auto reads = [](const std::vector<int>& items, const std::vector<int>& results) {
    Lines out;
    for (size_t i = 0; i < items.size(); ++i) {
      out.push_back("libsensor_reg: read " + std::to_string(items[i]) + " -> " +
                    std::to_string(results[i]) + " len " + (results[i] == 0 ? "1" : "0"));
    }
    return out;
  };
  struct Case {
    const char* name;
    std::string registry;
    int32_t sensor;
    Lines lines;  // after the walk's two lines
    std::vector<int32_t> words;
  };
  const Case cases[] = {
      {"two failed opens, then the registry opens and is read",
       "0 = 05\n1 = 00\n2 = 07\nopen_failures = 2\n",
       0,
       open_lines({-1, -1, 0}) + reads({0, 1, 2}, {0, 0, 0}) +
           Lines{"read_calib_data: ID=0, Type=0, Result=1, Val=5,0,7", "libsensor_reg: close -> 0"},
       {0, 5, 0, 7, 0, 0, 0, 0, 0, 0, 1}},
      {"it never opens: fifty attempts, the reads are made all the same and fail",
       "0 = 05\n1 = 00\n2 = 07\nopen_failures = 50\n",
       0,
       open_lines(std::vector<int>(50, -1)) + reads({0, 1, 2}, {-1, -1, -1}) +
           Lines{"read_calib_data: ID=0, Type=0, Result=-1, Val=0,0,0",
                 "libsensor_reg: close -> 0"},
       {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1}},
      {"one read of the light sensor fails: words 0 to 2 are cleared, the others kept",
       "102 = 01\n119 = 02\n120 = 03\n123 = 04\nread_error 124 = 5\n125 = 06\n126 = 07\n",
       4,
       open_lines({0}) + reads({102, 119, 120, 123, 124, 125, 126}, {0, 0, 0, 0, 5, 0, 0}) +
           Lines{"pdata.trim 0", "read_calib_data: ID=40, Type=5, Result=-1, Val=0,0,0",
                 "libsensor_reg: close -> 0"},
       {5, 0, 0, 0, 4, 0, 7, 6, 0, 0, -1}},
      {"the close fails after the report has gone out",
       "300 = 01\n301 = 02\n302 = 03\nclose_result = 7\n",
       1,
       open_lines({0}) + reads({300, 301, 302}, {0, 0, 0}) +
           Lines{"read_calib_data: ID=10, Type=1, Result=0, Val=1,2,3", "libsensor_reg: close -> 7",
                 "read_calib_data: Error in sensor_reg_close(): 7"},
       {1, 1, 2, 3, 0, 0, 0, 0, 0, 0, 0}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    write_file(test_registry_path(), c.registry);
    const Outcome o = rig.run(build_command(4, {c.sensor}));
    const int32_t type = c.words[0];
    EXPECT_EQ(o.lines, Lines({"process_message: 4",
                              "read_calib_data: sensor_type " + std::to_string(type) + "\n"}) +
                           c.lines);
    EXPECT_THAT(raw_frames(o), ElementsAre(frame_bytes(5, payload(c.words))));
  }
  remove_file(test_registry_path());
  expect_served(rig);
}

TEST(FaultMatrix, DiagFailuresKeepLoggingOffAndTheDaemonServing) {
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
       checks + Lines{"libdiag: Diag_LSM_Init fail", "sns_set_diag_mode: Diag_LSM_Init failed\n",
                      "libdiag: Diag_LSM_DeInit",
                      "sns_set_diag_tx_mode: sns_set_diag_mode result: -1\n"}},
      {"the buffering mode is refused",
       {{"KESTREL_DIAG_TX_MODE_RESULT", "0"}},
       false,
       checks + Lines{"libdiag: Diag_LSM_Init ok",
                      "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
                      "libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 0",
                      "sns_set_diag_mode: Failed configuring the peripheral tx_mode, result: 0\n",
                      "libdiag: Diag_LSM_DeInit",
                      "sns_set_diag_tx_mode: sns_set_diag_mode result: 0\n"}},
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
    EXPECT_EQ(rig.thread_lines_from("diag_logging_start_thread start\n"),
              Lines{"diag_logging_start_thread start\n"} + kOpened + c.decision);

    // Logging is off: a dump finds nothing to dump, the sensor states are still asked for.
    EXPECT_THAT(rig.run(build_command(27, {0, 0})).lines,
                ElementsAre("process_message: 27", "diag : Diabled Logging System\n"));
    auto states = rig.sim.next_request(5s);
    ASSERT_TRUE(states);
    EXPECT_EQ(states->header.msg_id, 64);

    // After a broken link the same decision is made again, with the same outcome.
    rig.sim.drop_connection();
    ASSERT_TRUE(rig.wait_for_text(kRefreshed, 10s));
    EXPECT_EQ(rig.thread_lines_from(kBrokenPipe),
              kLinkEnded + kOpened + Lines{"BROKEN_PIPE success to open sensor1\n"} + c.decision +
                  kRefreshThread);
    EXPECT_THAT(rig.tools.calls(), IsEmpty()) << "the tool was neither started nor stopped";
    expect_served(rig);
    if (c.uart_directory) rmdir(uart.c_str());
  }
}

TEST(FaultMatrix, AFloodOfDatagramsWhileASelfTestWaitsIsWalkedInOrderAfterwards) {
  Rig rig(false);
  // The self test's wait must outlast the sending of the flood: 8 s scaled to 0.8 s.
  rig.start({{"KESTREL_TIME_SCALE", "0.1"}});
  rig.wait_until_settled();
  const std::vector<int32_t> words = {1, 2, 3, 4, 5, 6, 7, 8};
  // Every datagram from first to end was walked, in order; the self test was answered first.
  auto expect_walked = [&](int first, int end) {
    auto reply = rig.kernel.next_frame_of_type(9, 10s);
    ASSERT_TRUE(reply);
    EXPECT_EQ(reply->raw, accel_reply(words));
    EXPECT_EQ(rig.run(build_command(4, {3})).frames.size(), 1u) << "the daemon still answers";
    Lines walked, expected;
    for (const std::string& l : rig.main_lines()) {
      EXPECT_FALSE(starts_with(l, "main: recvfrom(netlink)")) << "no receive failed";
      const int n = starts_with(l, "process_message: ") ? atoi(l.c_str() + 17) : -1;
      if (n >= first && n < end) walked.push_back(l);
    }
    for (int n = first; n < end; ++n) expected.push_back("process_message: " + std::to_string(n));
    EXPECT_EQ(walked, expected);
  };
  auto start_self_test = [&] {
    ASSERT_TRUE(rig.kernel.send(build_command(8, {0})));
    ASSERT_TRUE(rig.sim.next_request(5s)) << "the self test waits";
  };
  auto answer = [&] {
    rig.sim.indicate(Header{0, 13, 0, 4}, kestrel_sim::test_indication_body(0, 6, 0, 0, 0, words));
  };

  // A sender that does not wait: the datagrams queue on the daemon's socket until its buffer is
  // full; the next ones are refused to the sender (EAGAIN) and never reach the daemon.
  start_self_test();
  const int first = 2000;
  int next = first, refused_errno = 0;
  struct sockaddr_nl to = {};
  to.nl_family = AF_NETLINK;
  to.nl_pid = 20000;
  for (; next < first + 5000; ++next) {
    const Bytes d = build_command(static_cast<uint16_t>(next));
    if (sendto(rig.kernel.fd(), d.data(), d.size(), MSG_DONTWAIT,
               reinterpret_cast<struct sockaddr*>(&to), sizeof to) < 0) {
      refused_errno = errno;
      break;
    }
  }
  const int queued = next - first;
  std::cout << "[ observed ] " << queued << " datagrams of 16 bytes queued while the self test "
            << "waited; the next one was refused with errno " << refused_errno << "\n";
  EXPECT_EQ(refused_errno, EAGAIN);
  EXPECT_GT(queued, 0);
  answer();
  expect_walked(first, next);

  // A sender that waits: it blocks while the buffer is full and goes on once the daemon reads
  // again, so every datagram arrives.
  start_self_test();
  const int second = next, total = 3 * queued;
  std::atomic<int> sent{0};
  std::atomic<bool> finished{false};
  std::thread sender([&] {
    while (sent < total && rig.kernel.send(build_command(static_cast<uint16_t>(second + sent)))) {
      ++sent;
    }
    finished = true;
  });
  // Once as many as fit are queued, the sender waits for the daemon.
  while (sent < queued && !finished) std::this_thread::sleep_for(1ms);
  answer();
  sender.join();
  EXPECT_EQ(sent, total);
  expect_walked(second, second + total);
}

TEST(FaultMatrix, FramesToAnAbsentKernelAreLostWithoutATrace) {
  kestrel_sim::Simulator sim(test_socket_path(), true);
  FakeTools tools;
  std::optional<KernelPort> kernel(std::in_place);
  ASSERT_TRUE(kernel->open_bound(100));
  DaemonProcess daemon({}, tools.dir());
  ASSERT_TRUE(daemon.wait_for("main: do while start = 0\n", 10s));
  ASSERT_TRUE(kernel->next_frame_of_type(34, 10s));

  // Nobody holds the kernel's port: the report cannot be delivered. The commands come from
  // another port id; the daemon takes datagrams from any sender.
  kernel.reset();
  KernelPort other;
  ASSERT_TRUE(other.open_bound(101));
  ASSERT_TRUE(other.send(build_command(4, {3})));
  ASSERT_TRUE(other.send(build_command(1001)));
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
  kernel.emplace();
  ASSERT_TRUE(kernel->open_bound(100));
  ASSERT_TRUE(kernel->send(build_command(4, {0})));
  auto report = kernel->next_frame(10s);
  ASSERT_TRUE(report);
  EXPECT_EQ(report->raw, frame_bytes(5, payload({0, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1})));
  EXPECT_FALSE(daemon.wait_exit(0ms));
}

TEST(FaultMatrix, MalformedCommandsAreRefusedAndTheWalkGoesOn) {
  Rig rig;
  rig.start();
  rig.wait_until_settled();
  const std::pair<Bytes, Lines> cases[] = {
      // A frame longer than the datagram: the rest of the datagram is dropped.
      {build_frame(0, {0, 0, 0, 0}, 64), {"process_message: malformed netlink message\n"}},
      // A frame too short for its command's fields.
      {build_frame(8, {}),
       {"process_message: 8",
        "process_message: NETLINK_MESSAGE_SELFTEST refused: frame of 16 bytes, needs 20"}},
      // Bulk data longer than the request can carry.
      {build_command(22, {4, 300}),
       {"process_message: 22",
        "send_bigdata: command 22 refused: data length 300 (frame carries "
        "0 bytes, at most 256)"}},
      // A register dump of a sensor without registers.
      {build_command(19, {6}),
       {"process_message: 19",
        "process_message: NETLINK_MESSAGE_DUMP_REGISTER - sensor_type error"}},
  };
  for (const auto& c : cases) EXPECT_EQ(rig.run(c.first).lines, c.second);
  EXPECT_THAT(rig.sim.requests(), IsEmpty()) << "nothing reached the sensor service";
  expect_served(rig);
}

}  // namespace
