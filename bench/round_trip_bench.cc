// SPDX-License-Identifier: Apache-2.0
// The command round trip: an accelerometer self test (command 8, sensor_type 0) sent from the
// kernel side through a running kestreld and an in-process kestrel_sim::Simulator playing the
// healthy phone, until the type-9 reply is back; set against a bare ping-pong over the same hops
// without the daemon (a netlink datagram to a relay process, one record on a Unix stream socket to
// a Simulator and one back, and a netlink datagram back to the kernel side), and against the
// relays that add the duties of the daemon's design to it (round_trip_relay.cc).
//
// Everything runs side by side in the program's own network namespace: the daemon on its port
// id 20000 with the kernel side on 100, relay i on 20001 + i with its kernel side on 101 + i.
// Before them, a daemon of its own writes its log to a file: the records of a self test are
// counted there, and the relays with the log duty replay them.
#include <stdio.h>

#include <cmath>
#include <memory>

#include "bench/bench_support.h"
#include "bench/round_trip_relay.h"
#include "bench/selftest_log.h"
#include "byte_order.h"
#include "kernel_frame.h"
#include "sensor1_messages.h"
#include "tools/sim/simulator.h"

#ifndef KESTREL_RELAY_BINARY
#error "KESTREL_RELAY_BINARY names the relay program"
#endif

namespace {

using kestrel_bench::kAllDuties;
using kestrel_bench::kRelayCount;
using kestrel_bench::kRelays;
using kestrel_bench::NetlinkPort;
using kestrel_driver::ChildProcess;

// Start-up delays of the daemon, 5 s and more, at a twentieth.
constexpr double kTimeScale = 0.05;
constexpr auto kReplyTimeout = std::chrono::seconds(5);

// Words of a passing accelerometer self test.
const std::vector<int32_t> kAccelWords = {0, 1, 0, 0, 0, 0, 0, 0};

struct RelaySide {
  std::unique_ptr<NetlinkPort> kernel;
  std::unique_ptr<ChildProcess> process;
};

struct Setup {
  kestrel_driver::RunDir dir{"kestrel-bench"};
  // The daemon and its healthy phone.
  std::unique_ptr<kestrel_sim::Simulator> phone;
  std::unique_ptr<NetlinkPort> kernel;
  std::unique_ptr<ChildProcess> daemon;
  kestrel_bench::SelftestLog log;
  // The relays' simulators: the indication alone, or a response first.
  std::unique_ptr<kestrel_sim::Simulator> echo;
  std::unique_ptr<kestrel_sim::Simulator> echo_with_response;
  RelaySide relays[kRelayCount];
  std::string error;
};

std::unique_ptr<Setup> g_setup;

kestrel_sim::Simulator* relay_simulator(Setup& s, size_t i) {
  return (kRelays[i].duties & kestrel_bench::kResponseRecord) != 0 ? s.echo_with_response.get()
                                                                   : s.echo.get();
}

// The relays' simulators, then each relay, connected to its simulator.
void start_relays(Setup& s) {
  const std::vector<uint8_t> indication =
      kestrel_sim::test_indication_body(kSmgrAccel, 6, 0, 0, 0, kAccelWords);
  s.echo = std::make_unique<kestrel_sim::Simulator>(s.dir.file("echo.sock"));
  s.echo->set_request_hook(
      [indication](kestrel_sim::Simulator& sim, const kestrel_sim::Request& r) {
        sim.indicate_to(r.connection, {kServiceSmgr, kMsgSmgrSingleSensorTest, 0, r.header.txn_id},
                        indication);
      });
  // The healthy phone, as the daemon's: the response, then the indication.
  s.echo_with_response =
      std::make_unique<kestrel_sim::Simulator>(s.dir.file("echo2.sock"), /*healthy=*/true);
  const std::string records = s.dir.file("selftest-records.txt");
  if (!kestrel_bench::write_records(records, s.log)) {
    s.error = "the daemon's records of a self test could not be written";
    return;
  }
  for (size_t i = 0; i < kRelayCount && s.error.empty(); ++i) {
    kestrel_sim::Simulator* sim = relay_simulator(s, i);
    const int opened = sim->opened_connections();
    s.relays[i].process = std::make_unique<ChildProcess>(
        std::vector<std::string>{KESTREL_RELAY_BINARY, std::to_string(i), sim->socket_path(),
                                 records},
        kestrel_driver::current_environment());
    if (!kestrel_bench::wait_until([&] { return sim->opened_connections() > opened; },
                                   std::chrono::seconds(10))) {
      s.error = "a relay did not connect to its simulator";
    }
  }
}

// The daemon under measurement, ready once it has connected to the phone and only its lasting
// threads (main and the sensor1 library's) are left: its refresh thread has sent its frame.
void start_daemon(Setup& s) {
  const int opened = s.phone->opened_connections();
  s.daemon = std::make_unique<ChildProcess>(
      std::vector<std::string>{kestrel_bench::kestreld_binary()},
      kestrel_driver::daemon_environment(s.dir, s.phone->socket_path(), kTimeScale));
  std::vector<uint8_t> frame;
  if (!kestrel_driver::wait_up(
          s.daemon.get(), [&] { return s.phone->opened_connections() > opened; }, 2,
          std::chrono::seconds(30))) {
    s.error = "kestreld did not come up";
  } else if (!s.kernel->receive_type(FRAME_HH_REFRESH, std::chrono::seconds(5), &frame)) {
    s.error = "kestreld's refresh frame did not come";
  }
}

Setup& setup() {
  if (g_setup) return *g_setup;
  g_setup = std::make_unique<Setup>();
  Setup& s = *g_setup;
  s.kernel = std::make_unique<NetlinkPort>(kestrel_bench::kKernelPort);
  bool bound = s.kernel->ok();
  for (size_t i = 0; i < kRelayCount; ++i) {
    s.relays[i].kernel = std::make_unique<NetlinkPort>(kestrel_bench::relay_kernel_port(i));
    bound = bound && s.relays[i].kernel->ok();
  }
  if (!bound) {
    s.error = "the kernel side's netlink sockets could not be bound";
    return s;
  }
  s.phone = std::make_unique<kestrel_sim::Simulator>(s.dir.file("phone.sock"), /*healthy=*/true);
  s.log = kestrel_bench::record_selftest_log(s.dir, s.phone.get(), s.kernel.get(), kTimeScale);
  s.error = s.log.error;
  if (s.error.empty()) start_relays(s);
  if (s.error.empty()) start_daemon(s);
  return s;
}

// One command and its reply; false when no reply came.
bool round_trip(NetlinkPort* kernel, uint32_t to, const std::vector<uint8_t>& command,
                std::vector<uint8_t>* reply) {
  return kernel->send_to(to, command) && kernel->receive_type(FRAME_SELFTEST, kReplyTimeout, reply);
}

void run_round_trips(benchmark::State& state, NetlinkPort* kernel, uint32_t to,
                     kestrel_sim::Simulator* sim, pid_t measured) {
  const std::vector<uint8_t> command = kestrelctl::build_command(NETLINK_MESSAGE_SELFTEST, {0});
  std::vector<uint8_t> reply;
  // One untimed command first: the reply must be the accelerometer's.
  if (!round_trip(kernel, to, command, &reply) || reply.size() != 88 ||
      load_i32(reply.data(), 16) != 0) {
    state.SkipWithError("the first self test got no accelerometer reply");
    return;
  }
  int64_t n = 0;
  std::vector<double> latencies;
  latencies.reserve(1 << 16);
  const int64_t cpu_before = kestrel_driver::process_cpu_ns(measured);
  const long blocks_before = kestrel_driver::process_voluntary_switches(measured);
  for (auto _ : state) {
    const int64_t start = kestrel_bench::now_ns();
    if (!round_trip(kernel, to, command, &reply)) {
      state.SkipWithError("a self test got no reply");
      break;
    }
    latencies.push_back(static_cast<double>(kestrel_bench::now_ns() - start));
    // The simulator keeps every request; forget them now and then.
    if (++n % 4096 == 0) sim->clear_requests();
  }
  const int64_t cpu_after = kestrel_driver::process_cpu_ns(measured);
  const long blocks_after = kestrel_driver::process_voluntary_switches(measured);
  sim->clear_requests();
  // The latency of a typical command: on a shared machine the mean also carries the commands
  // that waited for a busy core.
  state.counters["p50_ns"] = kestrel_bench::median(latencies);
  // CPU time of the daemon (or of the relay) per command, all its threads together.
  state.counters["process_cpu_ns"] =
      static_cast<double>(cpu_after - cpu_before) / static_cast<double>(state.iterations());
  // Times a thread of the process blocked (on a socket, a lock or a condition) per command: each
  // is a sleep and a wake-up.
  state.counters["blocked_per_command"] =
      static_cast<double>(blocks_after - blocks_before) / static_cast<double>(state.iterations());
}

void BM_SelftestRoundTripDaemon(benchmark::State& state) {
  Setup& s = setup();
  if (!s.error.empty()) {
    state.SkipWithError(s.error.c_str());
    return;
  }
  run_round_trips(state, s.kernel.get(), kestrel_bench::kDaemonPort, s.phone.get(),
                  s.daemon->pid());
}

void BM_SelftestRoundTripRelay(benchmark::State& state, size_t i) {
  Setup& s = setup();
  if (!s.error.empty()) {
    state.SkipWithError(s.error.c_str());
    return;
  }
  run_round_trips(state, s.relays[i].kernel.get(), kestrel_bench::relay_port(i),
                  relay_simulator(s, i), s.relays[i].process->pid());
}

std::string relay_benchmark(size_t i) {
  return std::string("BM_SelftestRoundTrip") + kRelays[i].name;
}

void register_benchmarks() {
  benchmark::RegisterBenchmark("BM_SelftestRoundTripDaemon", BM_SelftestRoundTripDaemon)
      ->UseRealTime();
  for (size_t i = 0; i < kRelayCount; ++i) {
    benchmark::RegisterBenchmark(relay_benchmark(i).c_str(), BM_SelftestRoundTripRelay, i)
        ->UseRealTime();
  }
}

// The records a self test wrote, kept for the summary once the processes are gone.
double g_records_per_command = std::nan("");

void teardown() {
  if (g_setup && g_setup->log.error.empty()) {
    g_records_per_command = g_setup->log.records_per_command;
  }
  g_setup.reset();
}

// ---- Summary ----

const std::string kDaemon = "BM_SelftestRoundTripDaemon";

double p50(const kestrel_bench::RunRecords& runs, const std::string& name) {
  return kestrel_bench::counter(runs, name, "p50_ns");
}

void add_latencies(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  const std::string bare_name = relay_benchmark(0);
  const double daemon = p50(runs, kDaemon);
  const double bare = p50(runs, bare_name);
  const double ratio = daemon / bare;
  summary->add({"command round trip: self test (command 8), median", format_ns(daemon),
                "bare ping-pong over the same hops " + format_ns(bare), format_ratio(ratio),
                "<= 2x", verdict(ratio <= 2.0, !std::isnan(ratio))});
  const double daemon_mean = kestrel_bench::mean_real_ns(runs, kDaemon);
  const double bare_mean = kestrel_bench::mean_real_ns(runs, bare_name);
  summary->add({"  the same, mean", format_ns(daemon_mean),
                "bare ping-pong " + format_ns(bare_mean), format_ratio(daemon_mean / bare_mean),
                "-", "-"});
  for (size_t i = 1; i < kRelayCount; ++i) {
    const double relay = p50(runs, relay_benchmark(i));
    summary->add({std::string("  ") + kRelays[i].description + ", median", format_ns(relay),
                  "bare ping-pong " + format_ns(bare), format_ratio(relay / bare), "-", "-"});
  }
  const double duties = p50(runs, relay_benchmark(kAllDuties));
  summary->add({"  kestreld against the bare ping-pong with all three duties", format_ns(daemon),
                "with the duties " + format_ns(duties), format_ratio(daemon / duties), "-", "-"});
}

void add_costs(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  const std::string bare = relay_benchmark(0);
  const std::string duties = relay_benchmark(kAllDuties);
  const double daemon_cpu = counter(runs, kDaemon, "process_cpu_ns");
  const double relay_cpu = counter(runs, bare, "process_cpu_ns");
  const double duty_cpu = counter(runs, duties, "process_cpu_ns");
  summary->add({"CPU time of kestreld per self test", format_ns(daemon_cpu),
                "bare relay " + format_ns(relay_cpu), format_ratio(daemon_cpu / relay_cpu), "-",
                "-"});
  summary->add({"  the same, against the relay with all three duties", format_ns(daemon_cpu),
                "relay with the duties " + format_ns(duty_cpu), format_ratio(daemon_cpu / duty_cpu),
                "-", "-"});
  auto blocked = [&](const std::string& name) {
    return format_number(counter(runs, name, "blocked_per_command"), 1);
  };
  summary->add({"times a thread of kestreld blocked, per self test", blocked(kDaemon),
                "bare relay " + blocked(bare) + ", relay with the duties " + blocked(duties), "-",
                "-", "-"});
  summary->add({"log records written per self test", format_number(g_records_per_command, 1), "-",
                "-", "-", "-"});
}

void summarize(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  add_latencies(runs, summary);
  add_costs(runs, summary);
  summary->note(
      "Median: the median latency of the commands of a repetition, then the median "
      "over the repetitions; mean: the mean per command over all the repetitions. "
      "All runs were interleaved.");
  summary->note(
      "The duties, added to the bare ping-pong: the records the daemon itself logged for a self "
      "test, replayed through liblog's stderr logger; the hand-over from a reader thread to the "
      "main thread waiting on a condition variable; a response record before the indication.");
  summary->note(
      "CPU time: the run time of all threads of the process over the timed commands, "
      "per command.");
}

}  // namespace

int main(int argc, char** argv) {
  kestrel_bench::enter_private_network_namespace(argc, argv);
  register_benchmarks();
  return kestrel_bench::run_benchmarks(argc, argv, "Command round trip", summarize, teardown);
}
