// SPDX-License-Identifier: Apache-2.0
// The kestrel-sim program: serves the socket as a healthy phone, prints what it answers, refuses
// and drops connections when asked, and stops cleanly on SIGTERM.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include "sensor1_recorder.h"
#include "test_env.h"

namespace {

TEST(KestrelSimTest, RefusesDropsAnswersAndStopsOnSigterm) {
  const std::string daemon = KESTRELD_BINARY;
  const std::string program = daemon.substr(0, daemon.rfind('/')) + "/tools/sim/kestrel-sim";
  const std::string out = test_sysroot() + "/kestrel-sim.out";  // removed with the sysroot
  write_file(out, "");
  auto printed = [&] { return read_file(out); };
  struct Child {
    pid_t pid = fork();
    ~Child() {
      if (pid > 0 && kill(pid, SIGKILL) == 0) waitpid(pid, nullptr, 0);
    }
  } sim;
  if (sim.pid == 0) {  // without --socket it serves KESTREL_SENSOR1_SOCKET, the test's socket
    dup2(open(out.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), STDOUT_FILENO);
    execl(program.c_str(), program.c_str(), "--refuse-opens", "1", "--drop-after", "0", nullptr);
    _exit(127);
  }
  const std::string serving = "kestrel-sim: serving " + test_socket_path() + " as a healthy phone";
  ASSERT_TRUE(eventually([&] { return printed() == serving + "\n"; }));
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  EXPECT_EQ(rec.open(&h), 11);
  ASSERT_EQ(rec.open(&h), 0);
  ASSERT_TRUE(rec.wait_for(1));  // dropped at once
  EXPECT_EQ(sensor1_close(h), 0);
  ASSERT_EQ(rec.open(&h), 0);  // served again, and dropped no more
  ASSERT_EQ(write_request(h, {0, 13, 0, 4}, {0, 0, 0, 0, 6, 0, 0, 0, 1, 1, 0, 0}), 0);
  ASSERT_TRUE(rec.wait_for(3));  // the self test's response and indication
  EXPECT_EQ(sensor1_close(h), 0);
  ASSERT_TRUE(
      eventually([&] { return printed().find("connection 2 ended") != std::string::npos; }));
  kill(sim.pid, SIGTERM);
  int status = -1;
  ASSERT_TRUE(eventually([&] { return waitpid(sim.pid, &status, WNOHANG) == sim.pid; }));
  sim.pid = -1;
  EXPECT_EQ(status, 0) << "not an exit with status 0";
  EXPECT_EQ(printed(), serving +
                           "\nconnection 1 opened\ndropping connection 1\nconnection 1 ended\n"
                           "connection 2 opened\nrequest svc 0 msg 13 txn 4 size 12: self test "
                           "SensorID 0 TestType 6\nconnection 2 ended\nkestrel-sim: stopped\n");
  EXPECT_NE(access(test_socket_path().c_str(), F_OK), 0) << "the socket file was left behind";
  EXPECT_EQ(rec.summaries().size(), 3u);
  EXPECT_EQ(rec.summaries()[0], "250 [0 0 0 0] no body");
}

}  // namespace
