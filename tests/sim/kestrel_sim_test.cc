// The kestrel-sim program: serves the socket as a healthy phone, prints what it answers, refuses
// or drops connections when asked, and stops cleanly on SIGTERM.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <optional>
#include <string>
#include <thread>

#include "sensor1.h"
#include "sensor1_host.h"
#include "test_env.h"
#include "tests/sim/sensor1_recorder.h"

namespace {

using std::chrono_literals::operator""s;

std::string program_path() {
  const std::string daemon = KESTRELD_BINARY;
  return daemon.substr(0, daemon.rfind('/')) + "/tools/sim/kestrel-sim";
}

// kestrel-sim as a child process, its stdout going to a file.
class SimProcess {
 public:
  explicit SimProcess(std::vector<std::string> args) : out_(test_socket_path() + ".out") {
    args.insert(args.begin(), program_path());
    pid_ = fork();
    if (pid_ == 0) {
      const int fd = open(out_.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
      dup2(fd, STDOUT_FILENO);
      std::vector<char*> argv;
      for (std::string& a : args) argv.push_back(a.data());
      argv.push_back(nullptr);
      execv(argv[0], argv.data());
      _exit(127);
    }
  }
  ~SimProcess() {
    if (!exited_) kill(pid_, SIGKILL);
    if (!exited_) waitpid(pid_, nullptr, 0);
    unlink(out_.c_str());
  }
  std::vector<std::string> lines() const {
    std::ifstream in(out_);
    std::vector<std::string> out;
    for (std::string line; std::getline(in, line);) out.push_back(line);
    return out;
  }
  bool wait_for_line(const std::string& line) const {
    for (int i = 0; i < 500; ++i) {
      const std::vector<std::string> l = lines();
      if (std::find(l.begin(), l.end(), line) != l.end()) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
  }
  // Sends SIGTERM and returns the exit status once the program has ended.
  std::optional<int> terminate() {
    kill(pid_, SIGTERM);
    for (int i = 0; i < 500; ++i) {
      int status = 0;
      if (waitpid(pid_, &status, WNOHANG) == pid_) {
        exited_ = true;
        return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return std::nullopt;
  }

 private:
  const std::string out_;
  pid_t pid_ = -1;
  bool exited_ = false;
};

int write(sensor1_handle_s* h, int32_t msg_id, const std::vector<uint8_t>& body) {
  void* buf = nullptr;
  if (sensor1_alloc_msg_buf(h, static_cast<uint16_t>(body.size()), &buf) != 0) return -1;
  std::copy(body.begin(), body.end(), static_cast<uint8_t*>(buf));
  sensor1_msg_header_s hdr{0, msg_id, static_cast<uint16_t>(body.size()), 4};
  return sensor1_write(h, &hdr, buf);
}

TEST(KestrelSimTest, RefusesDropsAnswersAndStopsOnSigterm) {
  ASSERT_EQ(access(program_path().c_str(), X_OK), 0) << program_path() << " is not built";
  // Without --socket the program serves KESTREL_SENSOR1_SOCKET, the test's own socket.
  SimProcess sim({"--refuse-opens", "1", "--drop-after", "0"});
  const std::string serving = "kestrel-sim: serving " + test_socket_path() + " as a healthy phone";
  ASSERT_TRUE(sim.wait_for_line(serving));
  Sensor1Recorder rec;
  sensor1_handle_s* h = nullptr;
  EXPECT_EQ(rec.open(1, &h), 11);
  ASSERT_EQ(rec.open(1, &h), 0);
  ASSERT_TRUE(rec.wait_for(1));  // dropped at once
  EXPECT_EQ(summary(rec.deliveries()[0]), "250 [0 0 0 0] no body");
  EXPECT_EQ(sensor1_close(h), 0);

  ASSERT_EQ(rec.open(2, &h), 0);  // the program serves again, and drops no more
  ASSERT_EQ(write(h, 13, {0, 0, 0, 0, 6, 0, 0, 0, 1, 1, 0, 0}), 0);
  ASSERT_TRUE(rec.wait_for(2, 5s, 2));
  EXPECT_EQ(summary(rec.deliveries(2)[0]), "1 [0 13 2 4] 0000");
  EXPECT_EQ(rec.deliveries(2)[1].body.size(), 84u);
  EXPECT_EQ(sensor1_close(h), 0);
  ASSERT_TRUE(sim.wait_for_line("connection 2 ended"));
  EXPECT_EQ(sim.terminate(), std::optional<int>(0));
  EXPECT_EQ(sim.lines(), (std::vector<std::string>{
                             serving, "connection 1 opened", "dropping connection 1",
                             "connection 1 ended", "connection 2 opened",
                             "request svc 0 msg 13 txn 4 size 12: self test SensorID 0 TestType 6",
                             "connection 2 ended", "kestrel-sim: stopped"}));
  EXPECT_NE(access(test_socket_path().c_str(), F_OK), 0) << "the socket file was left behind";
  EXPECT_EQ(rec.deliveries(1).size(), 1u);
  EXPECT_EQ(sensor1_host_outstanding_bodies(), 0);
}

}  // namespace
