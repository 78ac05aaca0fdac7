// What the benchmark programs share: a private network namespace, the kernel side of the netlink
// channel, child processes (kestreld, kestrel-sim, the bare relays), /proc readings, and a
// reporter that turns the runs into figures set against their limits.
//
// Every program prints Google Benchmark's table, then a summary: one line a figure with the
// daemon's value, the limit it is measured against, their ratio and the target. With
// KESTREL_BENCH_SUMMARY naming a file, the summary is also written there as Markdown table rows
// (scripts/bench.sh assembles docs/performance.md from them).
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include <benchmark/benchmark.h>

#include "tools/ctl/kernel_port.h"

namespace kestrel_bench {

// Netlink port ids of the host build: the daemon's own and the one that plays the kernel.
constexpr uint32_t kDaemonPort = 20000;
constexpr uint32_t kKernelPort = 100;

// Re-executes the program under `unshare -rn` (`unshare -n` where user namespaces are not
// available) unless it already runs in the namespace it made. Netlink port ids and the daemon's
// guard port belong to the namespace, so nothing running on the machine is in the way.
void enter_private_network_namespace(int argc, char** argv);

// Nanoseconds of the monotonic clock.
int64_t now_ns();

// A directory of its own under the system's temporary directory, removed with everything in it.
// Its bin/ holds do-nothing stand-ins of the shell tools the daemon runs (diag_mdlog, chown,
// chmod), so DIAG start-up costs a fork and nothing more.
class TempDir {
 public:
  TempDir();  // kestrel-soak's run directory: bin() is its tools/
  ~TempDir();
  const std::string& path() const { return *path_; }
  std::string file(const std::string& name) const { return *path_ + "/" + name; }
  std::string bin() const { return *path_ + "/tools"; }

 private:
  std::unique_ptr<const std::string> path_;  // one owner removes the directory
};

// A child process: argv[0] is run with the current environment plus env (PATH gets path_prepend
// in front); stdout and stderr go to the named files ("" for /dev/null). Killed and reaped when
// destroyed.
class ChildProcess {
 public:
  ChildProcess(const std::vector<std::string>& argv, const std::map<std::string, std::string>& env,
               const std::string& path_prepend = "", const std::string& stderr_path = "",
               const std::string& stdout_path = "");
  ~ChildProcess();
  ChildProcess(const ChildProcess&) = delete;
  ChildProcess& operator=(const ChildProcess&) = delete;
  pid_t pid() const { return pid_; }
  bool running();

 private:
  pid_t pid_ = -1;
  bool reaped_ = false;
};

// The environment of a daemon under measurement: its sensor1 socket, its kernel port, a time
// scale that shortens the start-up delays, and a system root without DIAG-mode files.
std::map<std::string, std::string> daemon_env(const TempDir& dir, const std::string& socket,
                                              uint32_t kernel_port, double time_scale);

// Paths of the programs under measurement, set by the build.
std::string kestreld_binary();
std::string kestrel_sim_binary();
std::string self_binary();

// The kernel side: kestrelctl's KernelPort bound to a port id.
class NetlinkPort : public kestrelctl::KernelPort {
 public:
  explicit NetlinkPort(uint32_t port_id) { open_bound(port_id); }
  bool ok() const { return fd() >= 0; }
  // Waits for the next frame of the given type (frames of other types stay queued) and copies
  // the whole frame into frame. False on timeout.
  bool receive_type(uint16_t type, std::chrono::milliseconds timeout, std::vector<uint8_t>* frame);
  // Receives every datagram already queued on the socket, without waiting and many a system
  // call, and returns the number of frames of the given type among them.
  uint64_t drain(uint16_t type);
};

// The kernel side of a stream: a NetlinkPort whose thread receives everything as it comes, so
// the sender never finds the socket buffer full, and counts the frames of one type.
class FrameDrain {
 public:
  FrameDrain(uint32_t port_id, uint16_t counted_type);
  ~FrameDrain();
  FrameDrain(const FrameDrain&) = delete;
  FrameDrain& operator=(const FrameDrain&) = delete;
  bool ok() const { return port_.ok(); }
  uint64_t count() const { return count_.load(std::memory_order_acquire); }
  // now_ns() when the latest counted frame arrived.
  int64_t last_arrival_ns() const { return last_ns_.load(std::memory_order_acquire); }
  // Waits until count() reaches n. False on timeout.
  bool wait_for_count(uint64_t n, std::chrono::milliseconds timeout) const;

 private:
  void run();
  NetlinkPort port_;
  uint16_t type_;
  std::atomic<bool> stop_{false};
  std::atomic<uint64_t> count_{0};
  std::atomic<int64_t> last_ns_{0};
  std::thread thread_;
};

// /proc/<pid> readings.
struct ProcessStatus {
  long rss_kib = -1;       // VmRSS
  long rss_anon_kib = -1;  // RssAnon
  long rss_file_kib = -1;  // RssFile
  long hwm_kib = -1;       // VmHWM
  long threads = -1;       // Threads
};
ProcessStatus process_status(pid_t pid);
// utime + stime in clock ticks, -1 when unreadable.
long process_cpu_ticks(pid_t pid);
// Voluntary and involuntary context switches summed over the process's threads.
long process_context_switches(pid_t pid);
// Voluntary context switches alone (a thread blocked: it waited for a socket, a lock or a
// condition), summed over the process's threads.
long process_voluntary_switches(pid_t pid);
// CPU time of the process's live threads in nanoseconds (first field of each thread's
// schedstat), -1 when unreadable.
int64_t process_cpu_ns(pid_t pid);
// Number of threads (entries of /proc/<pid>/task).
long process_thread_count(pid_t pid);

// Polls cond every few milliseconds until it holds. False on timeout.
bool wait_until(const std::function<bool()>& cond, std::chrono::milliseconds timeout);

// Every run that the library reported, by benchmark name (repetitions together).
struct RunRecord {
  std::vector<double> real_ns;  // real time of one iteration, nanoseconds
  std::vector<double> cpu_ns;
  std::map<std::string, std::vector<double>> counters;
  std::string error;  // set when a run failed
};
using RunRecords = std::map<std::string, RunRecord>;

// Median of the values; NaN when there are none.
double median(std::vector<double> values);

// One line of the summary: a figure of the daemon set against its limit.
struct SummaryRow {
  std::string figure;   // what is measured
  std::string daemon;   // the daemon's value, with its unit
  std::string limit;    // the limit's value and what it is ("bare sendmsg 1.21 us")
  std::string ratio;    // daemon / limit ("1.12x"), or "-"
  std::string target;   // the target ("<= 1.25x"), or "-"
  std::string verdict;  // "meets", "misses", or "-" where there is no target
};

// The summary of one program, built by its summarize function from the runs.
class Summary {
 public:
  void add(SummaryRow row) { rows_.push_back(std::move(row)); }
  void note(std::string text) { notes_.push_back(std::move(text)); }
  const std::vector<SummaryRow>& rows() const { return rows_; }
  const std::vector<std::string>& notes() const { return notes_; }

 private:
  std::vector<SummaryRow> rows_;
  std::vector<std::string> notes_;
};

// Number formatting for the summary: "1.23 us", "456 ns", "1.12x".
std::string format_ns(double ns);
std::string format_ratio(double ratio);
std::string format_number(double value, int decimals);
// "meets" when ok, "misses" otherwise, "-" when a value is missing.
std::string verdict(bool ok, bool measured = true);

// Parses the library's flags, runs every registered benchmark with a reporter that records the
// runs, then calls summarize and prints (and writes) the summary. teardown runs after the
// benchmarks and before the summary, to stop the processes a program started. Returns the exit
// status: non-zero when a benchmark failed.
int run_benchmarks(int argc, char** argv, const std::string& title,
                   const std::function<void(const RunRecords&, Summary*)>& summarize,
                   const std::function<void()>& teardown = {});

}  // namespace kestrel_bench
