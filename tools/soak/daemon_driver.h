// SPDX-License-Identifier: Apache-2.0
// The daemon as a child process, as kestrel-soak, kestrel-chaos and the benchmarks run it: a run
// directory of its own, the daemon's environment, the child started and ended, and the log it
// writes to a file, read as it grows. Everything is meant to run inside a private network
// namespace, where the netlink port ids below are free.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <chrono>
#include <deque>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace kestrel_driver {

constexpr uint32_t kKernelPort = 100;
constexpr uint32_t kDaemonPort = 20000;

using Environment = std::map<std::string, std::string>;

// A directory of its own under /tmp, removed with everything in it unless kept: silent chown,
// chmod and diag_mdlog in tools/, an empty properties file and an empty root/.
class RunDir {
 public:
  explicit RunDir(const char* name);
  ~RunDir();
  RunDir(const RunDir&) = delete;
  RunDir& operator=(const RunDir&) = delete;
  bool ok() const { return !path_.empty(); }
  const std::string& path() const { return path_; }
  std::string file(const std::string& name) const { return path_ + "/" + name; }
  std::string tools() const { return file("tools"); }
  // Left in place, for whoever reads a failure report.
  void keep() { keep_ = true; }

 private:
  std::string path_;
  bool keep_ = false;
};

// This process's environment.
Environment current_environment();

// The daemon's environment for a run in dir: this process's environment with the host
// platform's settings for the run (the registry only when given, the stand-ins' other knobs at
// their defaults) and the silent tools first on PATH.
Environment daemon_environment(const RunDir& dir, const std::string& socket_path, double time_scale,
                               const std::string& registry = "");

// A child process: argv[0], looked up on PATH, run with exactly env; stdin and stdout on
// /dev/null, stderr appended to log_path ("" for /dev/null). It dies with the thread that started
// it; killed and reaped when destroyed. Every call may come from any thread.
class ChildProcess {
 public:
  ChildProcess(std::vector<std::string> argv, const Environment& env,
               const std::string& log_path = "");
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  pid_t pid() const { return pid_; }
  bool started() const { return pid_ > 0; }
  // True once it has ended within timeout, with its exit status (-signal when killed).
  bool wait_exit(std::chrono::milliseconds timeout, int* status = nullptr);
  bool running() { return started() && !wait_exit(std::chrono::milliseconds(0)); }
  void kill_and_reap();

 private:
  pid_t pid_ = -1;
  std::mutex mu_;
  bool ended_ = false;
  int status_ = 0;
};

// Polls cond every few milliseconds until it holds. False on timeout.
bool wait_until(const std::function<bool()>& cond, std::chrono::milliseconds timeout);

// Waits for a daemon to come up: connected() holds and only its lasting threads are left
// (idle_threads: main and the sensor1 library's), the start-up threads ended. False when it ended
// first or the time ran out.
bool wait_up(ChildProcess* daemon, const std::function<bool()>& connected, long idle_threads,
             std::chrono::milliseconds timeout);

// One record of the daemon's log: "<tag> <P> <MM-DD> <HH:MM:SS> <pid> <tid> <message>", the
// message going on over the lines that do not start a record.
struct LogRecord {
  int priority = 0;  // 2 (V) to 7 (F)
  std::string tag;
  long pid = 0;
  long tid = 0;
  std::string message;
};

// True when line starts a record, which then holds its fields and the message's first line.
bool parse_log_record(const std::string& line, LogRecord* record);

// The daemon's log file, read as it grows: its lines and records counted, the lines holding
// each pattern counted, and the latest lines kept for a failure report.
class DaemonLog {
 public:
  explicit DaemonLog(std::string path, std::vector<std::string> patterns = {});
  ~DaemonLog();
  DaemonLog(const DaemonLog&) = delete;
  DaemonLog& operator=(const DaemonLog&) = delete;
  const std::string& path() const { return path_; }
  // Reads the whole lines written since the last call; their records go to records when given
  // (a message whose further lines are not written yet ends early).
  void update(std::vector<LogRecord>* records = nullptr);
  long lines() const { return lines_; }
  long records() const { return records_; }
  const std::map<std::string, long>& seen() const { return seen_; }
  long seen(const std::string& pattern) const;
  const std::deque<std::string>& last() const { return last_; }
  // True when one of the latest lines holds text.
  bool recent(const std::string& text) const;
  // The latest lines on stderr, each after prefix, for a failure report.
  void print_last(const char* prefix);

 private:
  std::string path_;
  std::vector<std::string> patterns_;
  int fd_ = -1;
  std::string pending_;
  long lines_ = 0;
  long records_ = 0;
  std::map<std::string, long> seen_;
  std::deque<std::string> last_;
};

}  // namespace kestrel_driver
