// The pieces kestrel-soak and kestrel-chaos share: the daemon as a child process (run inside a
// private network namespace) with its private files, its log read line by line, its resources
// measured from /proc, and the commands of every kind it serves.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <chrono>
#include <deque>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace kestrel_soak {

constexpr uint32_t kKernelPort = 100;
constexpr uint32_t kDaemonPort = 20000;

// A directory of its own under /tmp: silent chown, chmod and diag_mdlog in tools/, an empty
// properties file and an empty root/. Empty on failure.
std::string make_run_dir(const char* name);

// Removes the directory and everything in it (a message on stderr when it cannot).
void remove_run_dir(const std::string& dir);

// This process's environment with the daemon's settings for a run in dir.
std::map<std::string, std::string> daemon_environment(const std::string& dir,
                                                      const std::string& socket_path,
                                                      double time_scale,
                                                      const std::string& registry);

// One command datagram and the frame type of its reply from a healthy phone (-1: none).
struct Planned {
  std::vector<uint8_t> datagram;
  int reply = -1;
};

constexpr int kCommandKinds = 26;

// Cycle c of the commands: every kind the daemon serves, varied by c. Command 36 runs four shell
// commands, each a process of its own, so it comes in every tenth cycle only.
std::vector<Planned> cycle(long c);

// The daemon's log: read from its stderr, counted by pattern, its latest lines kept for a
// failure report.
struct LogTally {
  std::mutex mu;
  std::deque<std::string> last;
  long lines = 0;
  std::map<std::string, long> seen;  // by pattern
};

// Reads fd until its end, then closes it.
void read_log(int fd, LogTally* log);

struct Usage {
  long rss_kb = -1;
  long anon_kb = -1;  // of which heap, stacks and other private memory
  long file_kb = -1;  // of which mapped files (code of the daemon and its libraries)
  int descriptors = -1;
  int threads = -1;
};

Usage usage_of(pid_t pid);

// Starts args (the daemon, or a tool that runs it) with env; its stderr comes out of *log_fd.
pid_t start_daemon(std::vector<std::string> args, const std::map<std::string, std::string>& env,
                   int* log_fd);

// The exit status once the process has ended within the timeout (-signal when killed).
bool wait_exit(pid_t pid, std::chrono::milliseconds timeout, int* status_out);

}  // namespace kestrel_soak
