// SPDX-License-Identifier: Apache-2.0
// Runs kestreld as a child process (in the test's own network namespace) with its stderr in a
// file, and reads its log records from there, as Debian's liblog writes them:
//   KESTRELD <P> <MM-DD> <HH:MM:SS> <pid> <tid> <message>
#pragma once

#include <sys/types.h>

#include <chrono>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "log_capture.h"

// Environment overrides of one daemon: DaemonProcess d(DaemonEnv{{"KESTREL_TIME_SCALE", "1"}}).
using DaemonEnv = std::map<std::string, std::string>;

class DaemonProcess {
 public:
  // Starts the daemon with the test's environment plus env (a value of "" unsets a variable).
  // path_prepend goes before PATH (the recording stand-ins of shell tools).
  explicit DaemonProcess(const DaemonEnv& env = {}, const std::string& path_prepend = "");
  ~DaemonProcess();  // kills the daemon if it still runs
  DaemonProcess(const DaemonProcess&) = delete;
  DaemonProcess& operator=(const DaemonProcess&) = delete;

  pid_t pid() const { return pid_; }
  // The records so far; a message's trailing newline shows once the next record has come.
  std::vector<LogRecord> records() const;
  std::vector<std::string> messages(const std::string& tag = "KESTRELD") const;
  // Waits until at least n records of tag carry message (its trailing newline not needed).
  bool wait_for(const std::string& message, std::chrono::milliseconds timeout, size_t n = 1,
                const std::string& tag = "KESTRELD") const;
  std::string output() const;  // everything written to stderr, for failure messages
  // Exit status once the process has ended within timeout (-signal when killed).
  std::optional<int> wait_exit(std::chrono::milliseconds timeout);

 private:
  std::string log_path_;
  pid_t pid_ = -1;
  std::optional<int> status_;
};
