// The pieces kestrel-soak and kestrel-chaos share: the daemon as a child process with its
// private files, its log read line by line, its resources measured from /proc, and the commands
// of every kind it serves.
#include "tools/soak/daemon_driver.h"

#include <dirent.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <thread>

#include "frame_codec.h"
#include "kernel_frame.h"

extern char** environ;

namespace kestrel_soak {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

namespace {

void write_text(const std::string& path, const std::string& text, mode_t mode = 0644) {
  std::ofstream(path, std::ios::trunc) << text;
  chmod(path.c_str(), mode);
}

int count_entries(const std::string& dir_path) {
  DIR* dir = opendir(dir_path.c_str());
  if (dir == nullptr) return -1;
  int n = 0;
  while (struct dirent* e = readdir(dir)) {
    if (e->d_name[0] != '.') ++n;
  }
  closedir(dir);
  return n;
}

}  // namespace

std::string make_run_dir(const char* name) {
  std::string tmpl = std::string("/tmp/") + name + "-XXXXXX";
  if (mkdtemp(tmpl.data()) == nullptr) return "";
  const std::string dir = tmpl;
  mkdir((dir + "/tools").c_str(), 0755);
  mkdir((dir + "/root").c_str(), 0755);
  for (const char* tool : {"chown", "chmod", "diag_mdlog"}) {
    write_text(dir + "/tools/" + tool, "#!/bin/sh\nexit 0\n", 0755);
  }
  write_text(dir + "/properties", "");
  return dir;
}

void remove_run_dir(const std::string& dir) {
  const std::string cmd = "rm -rf '" + dir + "'";
  if (system(cmd.c_str()) != 0) fprintf(stderr, "could not remove %s\n", dir.c_str());
}

std::map<std::string, std::string> daemon_environment(const std::string& dir,
                                                      const std::string& socket_path,
                                                      double time_scale,
                                                      const std::string& registry) {
  std::map<std::string, std::string> env;
  for (char** e = environ; *e != nullptr; ++e) {
    const char* eq = strchr(*e, '=');
    if (eq != nullptr) env[std::string(*e, static_cast<size_t>(eq - *e))] = eq + 1;
  }
  env["KESTREL_KERNEL_PORT"] = std::to_string(kKernelPort);
  env["KESTREL_SENSOR1_SOCKET"] = socket_path;
  env["KESTREL_PROPERTIES"] = dir + "/properties";
  env["KESTREL_SYSROOT"] = dir + "/root";
  char scale[32];
  snprintf(scale, sizeof scale, "%g", time_scale);
  env["KESTREL_TIME_SCALE"] = scale;
  if (!registry.empty()) env["KESTREL_SENSOR_REG"] = registry;
  env["PATH"] = dir + "/tools:" + env["PATH"];
  return env;
}

std::vector<Planned> cycle(long c) {
  using kestrelctl::build_bigdata;
  using kestrelctl::build_command;
  const int32_t sensor =
      static_cast<int32_t>(c % 4);            // accelerometer, gyro, magnetometer, pressure
  const int32_t stream = c % 2 == 0 ? 0 : 4;  // a sensor-manager or a light-sensor stream
  const int32_t calib[] = {0, 1, 2, 4};
  const std::vector<uint8_t> data = {1, 2, 3, 4, 5, 6, 7, 8};
  std::vector<Planned> out = {
      {build_command(0, {sensor}), 0},
      {build_command(1, {stream}), -1},
      {build_command(3, {stream}), 3},
      {build_command(4, {calib[c % 4]}), 5},
      {build_command(6, {sensor, 1}), 7},
      {build_command(8, {sensor}), sensor == 1 ? 14 : 9},
      {build_command(10), 10},
      {build_command(11), 11},
      {build_command(12), 12},
      {build_command(15), 15},
      {build_command(16), 16},
      {build_command(17), -1},
      {build_command(18), -1},
      {build_command(19, {static_cast<int32_t>(c % 6)}), 20},
  };
  out.push_back({build_command(27, {0, 2}), -1});
  for (const bigdata_kind& kind : kBigdataKinds) {
    out.push_back({build_bigdata(kind.command, 4, data), kind.reply_frame});
  }
  out.push_back({kestrelctl::build_hidden_hole({1, 2, 3, 4, 5, 6, 7, 8, 9}), -1});
  if (c % 10 == 9) out.push_back({build_command(36), -1});
  return out;
}

const char* const kLogPatterns[] = {
    "ERROR: No response for command",
    "sensor1_write -error",
    "sensor1_write error",
    "alloc_msg_buf error",
    "get_raw error",
    "BROKEN_PIPE",
    "on a closed handle",
    "malformed",
    "refused",
    "cb has arrived without waiting",
};

void read_log(int fd, LogTally* log) {
  std::string pending;
  char buf[65536];
  for (;;) {
    const ssize_t n = read(fd, buf, sizeof buf);
    if (n <= 0) break;
    pending.append(buf, static_cast<size_t>(n));
    size_t start = 0, nl;
    std::lock_guard<std::mutex> lock(log->mu);
    while ((nl = pending.find('\n', start)) != std::string::npos) {
      const std::string line = pending.substr(start, nl - start);
      start = nl + 1;
      ++log->lines;
      for (const char* pattern : kLogPatterns) {
        if (line.find(pattern) != std::string::npos) ++log->seen[pattern];
      }
      log->last.push_back(line);
      if (log->last.size() > 200) log->last.pop_front();
    }
    pending.erase(0, start);
  }
  close(fd);
}

Usage usage_of(pid_t pid) {
  Usage u;
  const std::string proc = "/proc/" + std::to_string(pid);
  std::ifstream status(proc + "/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind("VmRSS:", 0) == 0) u.rss_kb = atol(line.c_str() + 6);
    if (line.rfind("RssAnon:", 0) == 0) u.anon_kb = atol(line.c_str() + 8);
    if (line.rfind("RssFile:", 0) == 0) u.file_kb = atol(line.c_str() + 8);
  }
  u.descriptors = count_entries(proc + "/fd");
  u.threads = count_entries(proc + "/task");
  return u;
}

pid_t start_daemon(std::vector<std::string> args, const std::map<std::string, std::string>& env,
                   int* log_fd) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) return -1;
  std::vector<std::string> strings;
  for (const auto& kv : env) strings.push_back(kv.first + "=" + kv.second);
  std::vector<char*> envp;
  for (std::string& s : strings) envp.push_back(s.data());
  envp.push_back(nullptr);
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(a.data());
  argv.push_back(nullptr);

  const pid_t pid = fork();
  if (pid == 0) {
    dup2(fds[1], 2);
    const int null = open("/dev/null", O_RDWR);
    dup2(null, 0);
    dup2(null, 1);
    execvpe(argv[0], argv.data(), envp.data());
    _exit(127);
  }
  close(fds[1]);
  *log_fd = fds[0];
  return pid;
}

// The exit status once the process has ended within the timeout (-signal when killed).
bool wait_exit(pid_t pid, std::chrono::milliseconds timeout, int* status_out) {
  const auto deadline = Clock::now() + timeout;
  for (;;) {
    int status = 0;
    if (waitpid(pid, &status, WNOHANG) == pid) {
      *status_out = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
      return true;
    }
    if (Clock::now() >= deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
}

}  // namespace kestrel_soak
