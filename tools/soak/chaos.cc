// SPDX-License-Identifier: Apache-2.0
// kestrel-chaos: kestreld under a seeded random schedule of link faults and commands.
//
// The daemon runs as a child process (meant to be started inside a private network namespace,
// as scripts/chaos.sh does); this program plays the kernel factory driver on netlink port 100 and
// the sensor processor with an in-process simulator whose answers a ChaosPhone spoils. Commands
// of every kind go to the daemon one at a time, each followed by a probe (command 4, which the
// daemon answers from the registry alone), so the probe's reply tells when the daemon has
// finished with the command. Checked all along:
//   - the daemon ends only through its one exit under faults, a failed write whose close fails
//     (with the close's result); such an exit is counted and the daemon started again;
//   - every command is done within the daemon's 8 s wait, scaled, plus a margin;
//   - at every checkpoint (faults paused, the link rebuilt, the daemon quiet) its descriptors and
//     threads are those of its first checkpoint and its private memory has not grown;
//   - after the chaos, a healthy session gets byte for byte the frames that a fresh daemon gave
//     for it at the start.
// A failing run prints its seed and the command that replays it.
#include <linux/netlink.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "frame_codec.h"
#include "kernel_frame.h"
#include "kernel_port.h"
#include "tools/sim/chaos_phone.h"
#include "tools/sim/simulator.h"
#include "tools/soak/command_cycle.h"
#include "tools/soak/daemon_driver.h"
#include "tools/soak/proc_readings.h"
#include "tools/soak/tool_main.h"
#include "tools/soak/verdicts.h"

#ifndef KESTRELD_BINARY
#error "KESTRELD_BINARY names the daemon"
#endif

namespace {

using namespace kestrel_driver;
using Clock = std::chrono::steady_clock;
using Millis = std::chrono::milliseconds;
using namespace std::chrono_literals;

constexpr int32_t kCloseStatus = 77;  // the result of a faulted close
constexpr uint16_t kProbeCommand = 4;
// Motor enabled: a request nobody waits for, to make a daemon without a connection open one.
constexpr uint16_t kOpeningCommand = 17;
// get_status of a sensor the phone has no test for: its wait ends without an answer, so it takes
// any answer still flagged from before.
constexpr int32_t kSensorWithoutTests = 7;
// Longer than the daemon's longest pause at any time scale up to 0.1 (10 s before a coefficient
// refresh).
constexpr Millis kQuiet(1100);

struct Options {
  double minutes = 5;
  uint64_t seed = 1;
  double time_scale = 0.05;
  long margin_ms = 1000;
  int idle_threads = 2;  // main and the sensor1 library's thread
  // Resident private memory a daemon may gain between its first checkpoint and a later one
  // (negative: not compared).
  long memory_slack_kb = 64;
  std::string daemon = KESTRELD_BINARY;
  std::string registry;
  std::string replay;
};

bool parse_options(int argc, char** argv, Options* o) {
  const std::vector<ToolOption> options = {
      {"--minutes", "X", "length of the chaos (default 5)",
       [o](const char* v) { o->minutes = atof(v); }},
      {"--seed", "N", "seed of the schedule (default 1)",
       [o](const char* v) { o->seed = strtoull(v, nullptr, 10); }},
      {"--time-scale", "X", "KESTREL_TIME_SCALE of the daemon (default 0.05)",
       [o](const char* v) { o->time_scale = atof(v); }},
      {"--margin-ms", "N", "time beyond the scaled 8 s wait a command may take (default 1000)",
       [o](const char* v) { o->margin_ms = atol(v); }},
      {"--idle-threads", "N", "threads of an idle daemon (default 2)",
       [o](const char* v) { o->idle_threads = atoi(v); }},
      {"--memory-slack-kb", "N", "private memory a daemon may gain (default 64; -1: any)",
       [o](const char* v) { o->memory_slack_kb = atol(v); }},
      {"--registry", "FILE", "sensors registry (the probe's answer comes from it)",
       [o](const char* v) { o->registry = v; }},
      {"--daemon", "PATH", "the daemon (default: the one built beside this program)",
       [o](const char* v) { o->daemon = v; }},
      {"--replay", "TEXT", "the command that replays this run, printed when it fails",
       [o](const char* v) { o->replay = v; }},
  };
  return parse_tool_options(
             argc, argv,
             "usage: kestrel-chaos [options]   (run it in a network namespace of its own)",
             options) &&
         o->minutes >= 0 && o->time_scale > 0 && o->margin_ms >= 0;
}

class Chaos {
 public:
  explicit Chaos(const Options& o)
      : o_(o), dir_("kestrel-chaos"), log_(dir_.file("kestreld.log"), {"on a closed handle"}) {}
  int run();

 private:
  bool open();
  bool start_daemon_and_wait();
  bool daemon_ended() { return daemon_->wait_exit(0ms, &exit_status_); }
  void receive_frames();
  void chaos(std::vector<std::vector<uint8_t>>* reference,
             std::vector<std::vector<uint8_t>>* final_frames);
  bool one_command(std::mt19937_64* rng);
  void end();
  void print_figures();
  void check_sessions(const std::vector<std::vector<uint8_t>>& reference,
                      const std::vector<std::vector<uint8_t>>& final_frames);
  // Sends datagram and a probe; true once the probe's reply came within timeout.
  bool send_and_probe(const std::vector<uint8_t>& datagram, Millis timeout);
  bool settle(ProcessStatus* usage);
  bool checkpoint(const char* when);
  bool healthy_session(std::vector<std::vector<uint8_t>>* frames);
  bool specified_exit();
  bool check(bool ok, const std::string& what) { return verdicts_.check(ok, what); }
  void fail(const std::string& what);

  const Options& o_;
  RunDir dir_;
  DaemonLog log_;
  std::unique_ptr<kestrel_sim::Simulator> sim_;
  std::unique_ptr<kestrel_sim::ChaosPhone> phone_;
  kestrelctl::KernelPort rx_, tx_;
  std::thread receiver_;
  std::atomic<bool> stop_{false};

  std::unique_ptr<ChildProcess> daemon_;
  int exit_status_ = 0;

  std::mutex mu_;  // guards what follows, with cv_
  std::condition_variable cv_;
  long probes_ = 0;  // replies of the probe command
  bool recording_ = false;
  std::vector<std::vector<uint8_t>> recorded_;
  long overruns_ = 0;

  // Figures.
  long commands_ = 0;
  long waiting_commands_ = 0;
  long exits_ = 0;
  long checkpoints_ = 0;
  double slowest_ms_ = 0;
  uint16_t slowest_command_ = 0;
  Millis bound_{0};
  pid_t baseline_pid_ = -1;
  ProcessStatus baseline_, last_;
  Verdicts verdicts_{"chaos", 66};
};

void Chaos::fail(const std::string& what) {
  verdicts_.miss();
  fprintf(stderr, "chaos: FAILED: %s\n", what.c_str());
  log_.print_last("chaos");
  fprintf(stderr, "chaos: seed %llu; replay with: %s\n", static_cast<unsigned long long>(o_.seed),
          o_.replay.empty() ? "(not given)" : o_.replay.c_str());
}

void Chaos::receive_frames() {
  std::vector<kestrelctl::Frame> frames;
  std::string error;
  while (!stop_.load()) {
    frames.clear();
    const auto r = rx_.receive(100, &frames, &error);
    std::lock_guard<std::mutex> lock(mu_);
    if (r == kestrelctl::KernelPort::Wait::kOverrun) ++overruns_;
    for (const kestrelctl::Frame& f : frames) {
      if (f.type == FRAME_CALIBRATION_REPORT) ++probes_;
      if (recording_ && f.type != FRAME_SAMPLE && f.type != FRAME_HH_REFRESH) {
        recorded_.push_back(f.raw);
      }
    }
    if (!frames.empty()) cv_.notify_all();
  }
}

bool Chaos::send_and_probe(const std::vector<uint8_t>& datagram, Millis timeout) {
  long want;
  {
    std::lock_guard<std::mutex> lock(mu_);
    want = probes_ + 1 + (command_of(datagram) == kProbeCommand ? 1 : 0);
  }
  tx_.send(datagram);
  tx_.send(kestrelctl::build_command(kProbeCommand, {0}));
  std::unique_lock<std::mutex> lock(mu_);
  return cv_.wait_for(lock, timeout, [&] { return probes_ >= want; });
}

bool Chaos::start_daemon_and_wait() {
  const int opened = sim_->opened_connections();
  daemon_ = std::make_unique<ChildProcess>(
      std::vector<std::string>{o_.daemon},
      daemon_environment(dir_, sim_->socket_path(), o_.time_scale, o_.registry), log_.path());
  // Up: the start-up thread has opened the service and both start-up threads have ended.
  if (!wait_up(
          daemon_.get(), [&] { return sim_->opened_connections() > opened; }, o_.idle_threads,
          60s)) {
    fail("the daemon did not come up");
    return false;
  }
  return true;
}

// The link rebuilt without faults, nothing late still to come, no answer left flagged, the
// daemon's passing threads ended.
bool Chaos::settle(ProcessStatus* usage) {
  phone_->enable(false);
  const Millis timeout(8000 + o_.margin_ms * 4);
  auto deadline = Clock::now() + timeout;
  while (!phone_->settled() && Clock::now() < deadline) std::this_thread::sleep_for(10ms);
  // A new connection carries no FAULT armed on the old one.
  const int opened = sim_->opened_connections();
  sim_->drop_connection();
  deadline = Clock::now() + timeout;
  while (sim_->opened_connections() == opened || sim_->current_connection() == 0) {
    if (daemon_ended() || Clock::now() >= deadline) return false;
    // A daemon without a connection opens one for its next command.
    send_and_probe(kestrelctl::build_command(kOpeningCommand), 500ms);
  }
  if (!send_and_probe(kestrelctl::build_command(0, {kSensorWithoutTests}), timeout)) return false;
  // Quiet: the main thread and the library's alone, and no line logged for longer than any of
  // the daemon's scaled pauses (a link's rebuilding on the library's thread included).
  deadline = Clock::now() + timeout;
  for (;;) {
    log_.update();
    const long lines = log_.lines();
    std::this_thread::sleep_for(kQuiet);
    *usage = process_status(daemon_->pid());
    log_.update();
    if (usage->threads == o_.idle_threads && log_.lines() == lines) return true;
    if (daemon_ended() || Clock::now() >= deadline) return false;
  }
}

bool Chaos::checkpoint(const char* when) {
  ProcessStatus u;
  if (!settle(&u)) {
    if (!specified_exit()) fail(std::string("the daemon did not settle ") + when);
    return false;
  }
  ++checkpoints_;
  last_ = u;
  const pid_t pid = daemon_->pid();
  printf(
      "chaos: %-9s %5ld commands, %4ld exits; pid %d: rss %ld kB (anon %ld), %ld fds, %ld "
      "threads\n",
      when, commands_, exits_, pid, u.rss_kib, u.rss_anon_kib, u.descriptors, u.threads);
  // Memory used the first time a path runs (a thread's malloc arena, for one) is no growth: the
  // first checkpoint under chaos is the daemon's baseline.
  if (strcmp(when, "start") == 0) return true;
  if (baseline_pid_ != pid) {
    baseline_pid_ = pid;
    baseline_ = u;
    return true;
  }
  if (u.descriptors != baseline_.descriptors || u.threads != baseline_.threads ||
      (o_.memory_slack_kb >= 0 && u.rss_anon_kib > baseline_.rss_anon_kib + o_.memory_slack_kb)) {
    fail(std::string("resources grew ") + when);
    return false;
  }
  return true;
}

bool Chaos::healthy_session(std::vector<std::vector<uint8_t>>* frames) {
  {
    std::lock_guard<std::mutex> lock(mu_);
    recorded_.clear();
    recording_ = true;
  }
  bool ok = true;
  const Millis timeout(static_cast<long>(8000 * o_.time_scale) + o_.margin_ms);
  // Each command and its reply in turn: replies that the library's thread relays come whenever
  // the answer does, so each is waited for before the next command goes.
  for (const Planned& p : cycle(0)) {
    if (p.reply < 0 || command_of(p.datagram) == 3) continue;  // the stream stop needs a stream
    size_t from;
    {
      std::lock_guard<std::mutex> lock(mu_);
      from = recorded_.size();
    }
    tx_.send(p.datagram);
    std::unique_lock<std::mutex> lock(mu_);
    ok = cv_.wait_for(lock, timeout, [&] {
      for (size_t i = from; i < recorded_.size(); ++i) {
        if (command_of(recorded_[i]) == p.reply) return true;
      }
      return false;
    }) && ok;
  }
  std::this_thread::sleep_for(kQuiet);  // nothing more comes
  std::lock_guard<std::mutex> lock(mu_);
  recording_ = false;
  *frames = recorded_;
  return ok;
}

// True when the daemon ended through its exit under faults: a failed write whose close failed,
// with the close's result. It is then started again.
bool Chaos::specified_exit() {
  const auto deadline = Clock::now() + 2s;
  while (!daemon_ended() && Clock::now() < deadline) std::this_thread::sleep_for(10ms);
  if (!daemon_ended()) return false;
  log_.update();
  const bool logged = log_.recent("sensor1_close returned " + std::to_string(kCloseStatus));
  if (exit_status_ != kCloseStatus || !logged) {
    fail("the daemon ended with status " + std::to_string(exit_status_));
    return false;
  }
  ++exits_;
  phone_->enable(false);
  {
    std::lock_guard<std::mutex> lock(mu_);
    probes_ = 0;
  }
  return start_daemon_and_wait();
}

bool Chaos::open() {
  if (!dir_.ok()) {
    fprintf(stderr, "chaos: cannot create a temporary directory\n");
    return false;
  }
  sim_ = std::make_unique<kestrel_sim::Simulator>(dir_.file("sensor1.sock"), false);
  kestrel_sim::ChaosSettings settings;
  settings.seed = o_.seed;
  settings.time_scale = o_.time_scale;
  settings.close_status = kCloseStatus;
  phone_ = std::make_unique<kestrel_sim::ChaosPhone>(*sim_, settings);
  std::string error;
  if (!sim_->listening() || !rx_.open_bound(kKernelPort, &error) || !tx_.open_unbound(&error)) {
    fprintf(stderr, "chaos: cannot open the sockets (run it in a network namespace of its own)\n");
    return false;
  }
  receiver_ = std::thread([this] { receive_frames(); });
  return true;
}

// One command of a random kind, and its probe. False when the run must stop.
bool Chaos::one_command(std::mt19937_64* rng) {
  const std::vector<Planned> kinds = cycle(static_cast<long>((*rng)() % 1000));
  const Planned& p = kinds[(*rng)() % kinds.size()];
  const uint16_t command = command_of(p.datagram);
  const auto sent = Clock::now();
  const bool done = send_and_probe(p.datagram, bound_);
  const double ms = std::chrono::duration<double, std::milli>(Clock::now() - sent).count();
  ++commands_;
  if (done) {
    if (p.reply >= 0) ++waiting_commands_;
    if (ms > slowest_ms_) std::tie(slowest_ms_, slowest_command_) = std::pair(ms, command);
  } else if (!specified_exit()) {
    if (verdicts_.ok()) fail("command " + std::to_string(command) + " not done within its wait");
    return false;
  } else {
    phone_->enable(true);
  }
  std::this_thread::sleep_for(std::chrono::microseconds((*rng)() % 10000));
  return true;
}

// A healthy session, the faults and commands with a checkpoint every tenth of the time, and a
// healthy session again.
void Chaos::chaos(std::vector<std::vector<uint8_t>>* reference,
                  std::vector<std::vector<uint8_t>>* final_frames) {
  if (!start_daemon_and_wait() || !checkpoint("start")) return;
  const bool reference_ok = healthy_session(reference);
  std::mt19937_64 rng(o_.seed * 0x2545f4914f6cdd1dull + 1);
  const auto started = Clock::now();
  const auto end = started + std::chrono::duration_cast<Clock::duration>(
                                 std::chrono::duration<double>(o_.minutes * 60));
  const auto every = std::max<Clock::duration>(
      std::chrono::duration_cast<Clock::duration>((end - started) / 10), 10s);
  auto next_checkpoint = started + every;
  phone_->enable(true);
  while (verdicts_.ok() && Clock::now() < end) {
    if (Clock::now() >= next_checkpoint) {
      if (!checkpoint("chaos") && !verdicts_.ok()) break;
      phone_->enable(true);
      next_checkpoint = Clock::now() + every;
    }
    if (!one_command(&rng)) break;
  }
  phone_->enable(false);
  const bool final_ok = verdicts_.ok() && checkpoint("end") && healthy_session(final_frames);
  if (!reference_ok || !final_ok) final_frames->clear();
}

// The phone's faults stopped, the daemon and the receiver ended.
void Chaos::end() {
  phone_->enable(false);
  if (daemon_) daemon_->kill_and_reap();
  log_.update();
  stop_ = true;
  receiver_.join();
}

void Chaos::print_figures() {
  const auto injected = phone_->injected();
  printf("chaos: faults injected:");
  long faults = 0;
  for (size_t k = 0; k < kestrel_sim::kChaosFaultKinds; ++k) {
    printf("%s %s %ld", k == 0 ? "" : ";",
           kestrel_sim::chaos_fault_name(static_cast<kestrel_sim::ChaosFault>(k)), injected[k]);
    faults += injected[k];
  }
  printf(
      "\nchaos: %ld faults, %ld commands done (%ld bring a reply frame), slowest %.0f ms "
      "(command %u), %ld exits with the close's result and restarts, %ld checkpoints\n",
      faults, commands_, waiting_commands_, slowest_ms_, unsigned{slowest_command_}, exits_,
      checkpoints_);
  printf("chaos: first checkpoint of pid %d: rss %ld kB (anon %ld), %ld fds, %ld threads\n",
         baseline_pid_, baseline_.rss_kib, baseline_.rss_anon_kib, baseline_.descriptors,
         baseline_.threads);
  printf("chaos: last checkpoint:          rss %ld kB (anon %ld), %ld fds, %ld threads\n",
         last_.rss_kib, last_.rss_anon_kib, last_.descriptors, last_.threads);
  if (overruns_ > 0) printf("chaos: the kernel port's queue overflowed %ld times\n", overruns_);
  check(verdicts_.ok(), "the daemon ended only with the close's result, and settled each time");
  check(log_.seen("on a closed handle") == 0, "no sensor1 call on a closed handle");
  check(faults > 0 && commands_ > 0 && slowest_ms_ <= static_cast<double>(bound_.count()),
        "every command done within the scaled wait and the margin");
}

void Chaos::check_sessions(const std::vector<std::vector<uint8_t>>& reference,
                           const std::vector<std::vector<uint8_t>>& final_frames) {
  check(!reference.empty() && final_frames == reference,
        "a healthy session after the chaos: the frames of a fresh daemon, byte for byte");
  if (final_frames == reference) return;
  printf("chaos: %zu frames at the start, %zu at the end\n", reference.size(), final_frames.size());
  for (size_t i = 0; i < std::max(reference.size(), final_frames.size()); ++i) {
    const std::string a = i < reference.size() ? kestrelctl::to_hex(reference[i]) : "-";
    const std::string b = i < final_frames.size() ? kestrelctl::to_hex(final_frames[i]) : "-";
    if (a != b) printf("chaos: frame %zu: %s / %s\n", i, a.c_str(), b.c_str());
  }
}

int Chaos::run() {
  if (!open()) return 2;
  bound_ = Millis(static_cast<long>(8000 * o_.time_scale) + o_.margin_ms);
  printf("chaos: %s, seed %llu, %g minutes, time scale %g, every command done within %ld ms\n",
         o_.daemon.c_str(), static_cast<unsigned long long>(o_.seed), o_.minutes, o_.time_scale,
         static_cast<long>(bound_.count()));
  std::vector<std::vector<uint8_t>> reference, final_frames;
  chaos(&reference, &final_frames);
  end();
  print_figures();
  check_sessions(reference, final_frames);
  const int status = verdicts_.finish();
  if (status != 0) {
    fprintf(stderr, "chaos: seed %llu; replay with: %s\n", static_cast<unsigned long long>(o_.seed),
            o_.replay.empty() ? "(not given)" : o_.replay.c_str());
    dir_.keep();
  }
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  return kestrel_driver::tool_main<Chaos>(argc, argv, parse_options);
}
