// SPDX-License-Identifier: Apache-2.0
// The daemon as a child process: its run directory, environment, start and end, and its log file.
#include "tools/soak/daemon_driver.h"

#include <fcntl.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <sstream>
#include <thread>

#include "tools/soak/proc_readings.h"

extern char** environ;

namespace kestrel_driver {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

namespace {

constexpr size_t kLastLines = 200;

void write_text(const std::string& path, const std::string& text, mode_t mode = 0644) {
  std::ofstream(path, std::ios::trunc) << text;
  chmod(path.c_str(), mode);
}

std::vector<char*> pointers(std::vector<std::string>* strings) {
  std::vector<char*> out;
  for (std::string& s : *strings) out.push_back(s.data());
  out.push_back(nullptr);
  return out;
}

}  // namespace

RunDir::RunDir(const char* name) {
  std::string tmpl = std::string("/tmp/") + name + "-XXXXXX";
  if (mkdtemp(tmpl.data()) == nullptr) return;
  path_ = tmpl;
  mkdir(tools().c_str(), 0755);
  mkdir(file("root").c_str(), 0755);
  for (const char* tool : {"chown", "chmod", "diag_mdlog"}) {
    write_text(tools() + "/" + tool, "#!/bin/sh\nexit 0\n", 0755);
  }
  write_text(file("properties"), "");
}

RunDir::~RunDir() {
  if (path_.empty() || keep_) return;
  const std::string cmd = "rm -rf '" + path_ + "'";
  if (system(cmd.c_str()) != 0) fprintf(stderr, "could not remove %s\n", path_.c_str());
}

Environment current_environment() {
  Environment env;
  for (char** e = environ; *e != nullptr; ++e) {
    const char* eq = strchr(*e, '=');
    if (eq != nullptr) env[std::string(*e, static_cast<size_t>(eq - *e))] = eq + 1;
  }
  return env;
}

Environment daemon_environment(const RunDir& dir, const std::string& socket_path, double time_scale,
                               const std::string& registry) {
  Environment env = current_environment();
  for (const char* name : {"KESTREL_SENSOR_REG", "KESTREL_SENSOR1_INIT_RESULT", "KESTREL_DIAG_INIT",
                           "KESTREL_DIAG_TX_MODE_RESULT"}) {
    env.erase(name);
  }
  env["KESTREL_KERNEL_PORT"] = std::to_string(kKernelPort);
  env["KESTREL_SENSOR1_SOCKET"] = socket_path;
  env["KESTREL_PROPERTIES"] = dir.file("properties");
  env["KESTREL_SYSROOT"] = dir.file("root");
  char scale[32];
  snprintf(scale, sizeof scale, "%g", time_scale);
  env["KESTREL_TIME_SCALE"] = scale;
  if (!registry.empty()) env["KESTREL_SENSOR_REG"] = registry;
  env["PATH"] = dir.tools() + (env.count("PATH") ? ":" + env["PATH"] : "");
  return env;
}

ChildProcess::ChildProcess(std::vector<std::string> argv, const Environment& env,
                           const std::string& log_path) {
  // Everything the child needs is prepared here: after fork only exec-safe calls are made.
  std::vector<std::string> strings;
  for (const auto& [name, value] : env) strings.push_back(name + "=" + value);
  std::vector<char*> envp = pointers(&strings);
  std::vector<char*> args = pointers(&argv);
  const int err_fd = open(log_path.empty() ? "/dev/null" : log_path.c_str(),
                          O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  const int null_fd = open("/dev/null", O_RDWR | O_CLOEXEC);
  const pid_t parent = getpid();
  fflush(stdout);
  fflush(stderr);
  pid_ = fork();
  if (pid_ == 0) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent) _exit(127);
    dup2(null_fd, 0);
    dup2(null_fd, 1);
    dup2(err_fd, 2);
    execvpe(args[0], args.data(), envp.data());
    _exit(127);
  }
  close(err_fd);
  close(null_fd);
}

ChildProcess::~ChildProcess() {
  kill_and_reap();
}

bool ChildProcess::wait_exit(std::chrono::milliseconds timeout, int* status_out) {
  const auto deadline = Clock::now() + timeout;
  for (;;) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      int status = 0;
      if (!ended_ && pid_ > 0 && waitpid(pid_, &status, WNOHANG) == pid_) {
        ended_ = true;
        status_ = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
      }
      if (ended_ || pid_ <= 0) {
        if (status_out != nullptr) *status_out = status_;
        return true;
      }
    }
    if (Clock::now() >= deadline) return false;
    std::this_thread::sleep_for(5ms);
  }
}

void ChildProcess::kill_and_reap() {
  if (!started() || wait_exit(0ms)) return;
  kill(pid_, SIGKILL);
  wait_exit(std::chrono::hours(1));
}

bool wait_until(const std::function<bool()>& cond, std::chrono::milliseconds timeout) {
  const auto deadline = Clock::now() + timeout;
  for (;;) {
    if (cond()) return true;
    if (Clock::now() > deadline) return false;
    std::this_thread::sleep_for(2ms);
  }
}

bool wait_up(ChildProcess* daemon, const std::function<bool()>& connected, long idle_threads,
             std::chrono::milliseconds timeout) {
  bool ended = false;
  wait_until(
      [&] {
        ended = daemon->wait_exit(0ms);
        return ended || (connected() && process_thread_count(daemon->pid()) == idle_threads);
      },
      timeout);
  return !ended && connected() && process_thread_count(daemon->pid()) == idle_threads;
}

bool parse_log_record(const std::string& line, LogRecord* record) {
  std::istringstream in(line);
  std::string tag, prio, date, time, pid, tid;
  in >> tag >> prio >> date >> time >> pid >> tid;
  const size_t p = prio.size() == 1 ? std::string("??VDIWEF").find(prio[0]) : 0;
  if (p < 2 || p == std::string::npos || date.size() != 5 || date[2] != '-' || time.size() != 8 ||
      pid.empty() || pid.find_first_not_of("0123456789") != std::string::npos || tid.empty() ||
      tid.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  // Exactly one blank separates the thread id from the message, which may start with blanks.
  const size_t at = in.eof() ? line.size() : static_cast<size_t>(in.tellg()) + 1;
  *record = {static_cast<int>(p), tag, atol(pid.c_str()), atol(tid.c_str()),
             at < line.size() ? line.substr(at) : ""};
  return true;
}

DaemonLog::DaemonLog(std::string path, std::vector<std::string> patterns)
    : path_(std::move(path)), patterns_(std::move(patterns)) {}

DaemonLog::~DaemonLog() {
  if (fd_ >= 0) close(fd_);
}

void DaemonLog::update(std::vector<LogRecord>* records) {
  if (fd_ < 0) fd_ = open(path_.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd_ < 0) return;
  char buf[65536];
  for (ssize_t n; (n = read(fd_, buf, sizeof buf)) > 0;)
    pending_.append(buf, static_cast<size_t>(n));
  size_t start = 0;
  for (size_t nl; (nl = pending_.find('\n', start)) != std::string::npos; start = nl + 1) {
    const std::string line = pending_.substr(start, nl - start);
    ++lines_;
    LogRecord record;
    if (parse_log_record(line, &record)) {
      ++records_;
      if (records != nullptr) records->push_back(record);
    } else if (records != nullptr && !records->empty()) {
      records->back().message += "\n" + line;
    }
    for (const std::string& pattern : patterns_) {
      if (line.find(pattern) != std::string::npos) ++seen_[pattern];
    }
    last_.push_back(line);
    if (last_.size() > kLastLines) last_.pop_front();
  }
  pending_.erase(0, start);
}

long DaemonLog::seen(const std::string& pattern) const {
  const auto it = seen_.find(pattern);
  return it == seen_.end() ? 0 : it->second;
}

void DaemonLog::print_last(const char* prefix) {
  update();
  fprintf(stderr, "%s: the daemon's last log lines:\n", prefix);
  for (const std::string& line : last_) {
    if (!line.empty()) fprintf(stderr, "  %s\n", line.c_str());
  }
}

bool DaemonLog::recent(const std::string& text) const {
  for (const std::string& line : last_) {
    if (line.find(text) != std::string::npos) return true;
  }
  return false;
}

}  // namespace kestrel_driver
