// SPDX-License-Identifier: Apache-2.0
// The idle footprint: resident memory and threads of a kestreld that has started up, connected
// to kestrel-sim and finished its start-up threads (the DIAG start thread and the refresh
// thread), and the CPU time it takes over 60 idle seconds: zero, since nothing in it polls.
//
// The daemon runs at a time scale of 0.05, so its start-up delays (5 s, 3 s, 10 s and the DIAG
// pauses) pass in about a second; memory and idling do not depend on it. KESTREL_BENCH_IDLE_SECONDS
// shortens the idle period for a quick look.
#include <stdlib.h>
#include <unistd.h>

#include <cmath>
#include <memory>

#include "bench/bench_support.h"
#include "kernel_frame.h"

namespace {

using kestrel_driver::ChildProcess;

constexpr double kTimeScale = 0.05;
constexpr double kRssTargetKib = 4096;

int idle_seconds() {
  const char* text = getenv("KESTREL_BENCH_IDLE_SECONDS");
  const int n = text != nullptr ? atoi(text) : 0;
  return n > 0 ? n : 60;
}

// kestrel-sim and kestreld in dir, the daemon idle: connected to the simulator, the refresh
// thread's frame sent, and only the threads that last (main and the sensor1 library's) left, for
// a whole second. Empty, or what went wrong.
struct IdleDaemon {
  kestrel_driver::RunDir dir{"kestrel-bench"};
  std::unique_ptr<ChildProcess> sim;
  std::unique_ptr<ChildProcess> daemon;
  std::string error;
};

void start_idle(kestrel_bench::NetlinkPort* kernel, IdleDaemon* idle) {
  const std::string socket = idle->dir.file("sensor1.sock");
  idle->sim = std::make_unique<ChildProcess>(
      std::vector<std::string>{kestrel_bench::kestrel_sim_binary(), "--quiet", "--socket", socket},
      kestrel_driver::current_environment());
  if (!kestrel_bench::wait_until([&] { return access(socket.c_str(), F_OK) == 0; },
                                 std::chrono::seconds(10))) {
    idle->error = "kestrel-sim did not come up";
    return;
  }
  kestrel_driver::DaemonLog log(idle->dir.file("kestreld.log"));
  idle->daemon = std::make_unique<ChildProcess>(
      std::vector<std::string>{kestrel_bench::kestreld_binary()},
      kestrel_driver::daemon_environment(idle->dir, socket, kTimeScale), log.path());
  std::vector<uint8_t> frame;
  if (!kernel->receive_type(FRAME_HH_REFRESH, std::chrono::seconds(30), &frame)) {
    idle->error = "the refresh frame did not come";
    return;
  }
  if (!kestrel_bench::wait_until([&] { return log.update(), log.recent("open -> 0"); },
                                 std::chrono::seconds(10))) {
    idle->error = "kestreld did not connect to kestrel-sim";
    return;
  }
  const pid_t pid = idle->daemon->pid();
  long threads = -1;
  int64_t stable_since = kestrel_bench::now_ns();
  kestrel_bench::wait_until(
      [&] {
        const long n = kestrel_driver::process_thread_count(pid);
        if (n != threads) {
          threads = n;
          stable_since = kestrel_bench::now_ns();
        }
        return n <= 2 && kestrel_bench::now_ns() - stable_since > 1000000000;
      },
      std::chrono::seconds(30));
}

// What /proc says of the daemon's CPU time and context switches.
struct CpuReadings {
  long ticks;
  int64_t ns;
  long switches;
};

CpuReadings cpu_readings(pid_t pid) {
  return {kestrel_driver::process_cpu_ticks(pid), kestrel_driver::process_cpu_ns(pid),
          kestrel_driver::process_context_switches(pid)};
}

void BM_IdleFootprint(benchmark::State& state) {
  kestrel_bench::NetlinkPort kernel(kestrel_bench::kKernelPort);
  if (!kernel.ok()) {
    state.SkipWithError("the kernel side's netlink socket could not be bound");
    return;
  }
  IdleDaemon idle;
  start_idle(&kernel, &idle);
  if (!idle.error.empty()) {
    state.SkipWithError(idle.error.c_str());
    return;
  }
  const pid_t pid = idle.daemon->pid();
  const kestrel_driver::ProcessStatus at_start = kestrel_driver::process_status(pid);
  const CpuReadings before = cpu_readings(pid);
  const int seconds = idle_seconds();
  for (auto _ : state) {
    sleep(static_cast<unsigned>(seconds));
    state.SetIterationTime(seconds);
  }
  const CpuReadings after = cpu_readings(pid);
  const kestrel_driver::ProcessStatus at_end = kestrel_driver::process_status(pid);
  if (!idle.daemon->running()) {
    state.SkipWithError("kestreld ended while idle");
    return;
  }
  state.counters["rss_kib"] = static_cast<double>(at_start.rss_kib);
  state.counters["rss_anon_kib"] = static_cast<double>(at_start.rss_anon_kib);
  state.counters["rss_file_kib"] = static_cast<double>(at_start.rss_file_kib);
  state.counters["hwm_kib"] = static_cast<double>(at_start.hwm_kib);
  state.counters["rss_after_idle_kib"] = static_cast<double>(at_end.rss_kib);
  state.counters["threads"] = static_cast<double>(at_start.threads);
  state.counters["idle_s"] = seconds;
  state.counters["cpu_ticks"] = static_cast<double>(after.ticks - before.ticks);
  state.counters["cpu_ns"] = static_cast<double>(after.ns - before.ns);
  state.counters["context_switches"] = static_cast<double>(after.switches - before.switches);
}

BENCHMARK(BM_IdleFootprint)
    ->Iterations(1)
    ->Repetitions(1)
    ->UseManualTime()
    ->Unit(benchmark::kSecond);

void summarize(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  auto value = [&](const std::string& key) { return counter(runs, "BM_IdleFootprint", key); };
  const double rss = value("rss_kib");
  const double idle = value("idle_s");
  const double ticks = value("cpu_ticks");
  const double cpu_ns = value("cpu_ns");
  const double switches = value("context_switches");
  const std::string over = format_number(idle, 0) + " idle s";
  summary->add({"idle resident memory (VmRSS)",
                format_number(rss, 0) + " KiB (" + format_number(rss / 1024, 2) + " MiB)", "4 MiB",
                format_ratio(rss / kRssTargetKib), "< 4 MiB",
                verdict(rss < kRssTargetKib, !std::isnan(rss))});
  summary->add({"  of which anonymous (RssAnon)", format_number(value("rss_anon_kib"), 0) + " KiB",
                "-", "-", "-", "-"});
  summary->add({"  of which file-backed (RssFile)",
                format_number(value("rss_file_kib"), 0) + " KiB", "-", "-", "-", "-"});
  summary->add({"peak resident memory (VmHWM)", format_number(value("hwm_kib"), 0) + " KiB", "-",
                "-", "-", "-"});
  summary->add({"resident memory after the idle period",
                format_number(value("rss_after_idle_kib"), 0) + " KiB", "-", "-", "-", "-"});
  summary->add({"threads when idle", format_number(value("threads"), 0), "-", "-", "-", "-"});
  summary->add({"CPU time over " + over + " (utime+stime)", format_number(ticks, 0) + " ticks", "0",
                "-", "0", verdict(ticks == 0, !std::isnan(ticks))});
  summary->add({"CPU time over " + over + " (schedstat)", format_ns(cpu_ns), "-", "-", "-", "-"});
  summary->add({"context switches over " + over, format_number(switches, 0), "-", "-", "-", "-"});
  summary->note(
      "kestreld ran with kestrel-sim connected; measured after the refresh frame had "
      "come and only the lasting threads were left for a second.");
  summary->note(
      "utime+stime from /proc/<pid>/stat in clock ticks; schedstat is the "
      "nanosecond run time of the daemon's threads; context switches are summed over "
      "its threads (0: no thread woke up).");
}

}  // namespace

int main(int argc, char** argv) {
  kestrel_bench::enter_private_network_namespace(argc, argv);
  return kestrel_bench::run_benchmarks(argc, argv, "Idle footprint", summarize);
}
