// SPDX-License-Identifier: Apache-2.0
#include "daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include "test_env.h"
#include "tools/soak/daemon_driver.h"

#ifndef KESTRELD_BINARY
#error "KESTRELD_BINARY must name the daemon under test"
#endif

DaemonProcess::DaemonProcess(const DaemonEnv& env, const std::string& path_prepend) {
  static int started = 0;
  log_path_ = std::string(getenv("KESTREL_SENSOR1_SOCKET")) + ".daemon" +
              std::to_string(started++) + ".log";
  kestrel_driver::Environment merged = kestrel_driver::current_environment();
  for (const auto& kv : env) merged[kv.first] = kv.second;
  if (!path_prepend.empty()) merged["PATH"] = path_prepend + ":" + merged["PATH"];
  std::vector<std::string> strings;
  for (const auto& kv : merged) {
    if (!kv.second.empty()) strings.push_back(kv.first + "=" + kv.second);
  }
  std::vector<char*> envp;
  for (auto& s : strings) envp.push_back(s.data());
  envp.push_back(nullptr);
  const int log = open(log_path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  const int devnull = open("/dev/null", O_RDWR | O_CLOEXEC);
  pid_ = fork();
  if (pid_ == 0) {
    dup2(log, 2);
    dup2(devnull, 0);
    dup2(devnull, 1);
    char* argv[] = {const_cast<char*>(KESTRELD_BINARY), nullptr};
    execve(KESTRELD_BINARY, argv, envp.data());
    _exit(127);
  }
  close(log);
  close(devnull);
}

DaemonProcess::~DaemonProcess() {
  if (!status_ && pid_ > 0) {
    kill(pid_, SIGKILL);
    wait_exit(std::chrono::milliseconds(5000));
  }
  for (const LogRecord& r : records()) {
    EXPECT_FALSE(r.tag == "libsensor1" && r.message.find("on a closed handle") != std::string::npos)
        << r.message;
  }
  unlink(log_path_.c_str());
}

std::string DaemonProcess::output() const {
  return read_file(log_path_);
}

// The last line, still being written, is left out.
std::vector<LogRecord> DaemonProcess::records() const {
  const std::string text = output();
  std::vector<LogRecord> out;
  for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos;
       start = end + 1) {
    const std::string line = text.substr(start, end - start);
    kestrel_driver::LogRecord r;
    if (kestrel_driver::parse_log_record(line, &r)) {
      out.push_back({r.priority, r.tag, r.message, r.tid});
    } else if (!out.empty()) {
      out.back().message += "\n" + line;
    }
  }
  return out;
}

std::vector<std::string> DaemonProcess::messages(const std::string& tag) const {
  return messages_of(records(), tag);
}

bool DaemonProcess::wait_for(const std::string& message, std::chrono::milliseconds timeout,
                             size_t n, const std::string& tag) const {
  const std::string bare =
      !message.empty() && message.back() == '\n' ? message.substr(0, message.size() - 1) : message;
  return eventually(
      [&] {
        size_t seen = 0;
        for (const LogRecord& r : records()) {
          seen += r.tag == tag && (r.message == message || r.message == bare);
        }
        return seen >= n;
      },
      timeout);
}

std::optional<int> DaemonProcess::wait_exit(std::chrono::milliseconds timeout) {
  const bool ended = eventually(
      [&] {
        int status = 0;
        if (!status_ && waitpid(pid_, &status, WNOHANG) == pid_) {
          status_ = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
        }
        return status_.has_value();
      },
      timeout);
  return ended ? status_ : std::nullopt;
}
