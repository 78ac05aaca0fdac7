// SPDX-License-Identifier: Apache-2.0
// What the benchmark programs share beside the daemon driver (the daemon, kestrel-sim and the bare
// relays as child processes, and their /proc readings): a private network namespace, the kernel
// side of the netlink channel, and a reporter that turns the runs into figures set against their
// limits.
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
#include "tools/soak/daemon_driver.h"
#include "tools/soak/proc_readings.h"

namespace kestrel_bench {

using kestrel_driver::kDaemonPort;
using kestrel_driver::kKernelPort;
using kestrel_driver::wait_until;

// Re-executes the program under `unshare -rn` (`unshare -n` where user namespaces are not
// available) unless it already runs in the namespace it made. Netlink port ids and the daemon's
// guard port belong to the namespace, so nothing running on the machine is in the way.
void enter_private_network_namespace(int argc, char** argv);

// Nanoseconds of the monotonic clock.
int64_t now_ns();

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

// Every run that the library reported, by benchmark name (repetitions together).
struct RunRecord {
  std::vector<double> real_ns;  // real time of one iteration, nanoseconds
  std::vector<double> cpu_ns;
  std::map<std::string, std::vector<double>> counters;
  std::string error;  // set when a run failed
};
using RunRecords = std::map<std::string, RunRecord>;

// Median and mean of the values; NaN when there are none.
double median(std::vector<double> values);
double mean(const std::vector<double>& values);
// A benchmark's real time of one iteration, nanoseconds, as the median or the mean over its
// repetitions; NaN when it did not run.
double median_real_ns(const RunRecords& runs, const std::string& benchmark);
double mean_real_ns(const RunRecords& runs, const std::string& benchmark);
// The median over the repetitions of a benchmark's counter; NaN when it has none.
double counter(const RunRecords& runs, const std::string& benchmark, const std::string& key);

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
