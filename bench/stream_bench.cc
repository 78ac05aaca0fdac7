// SPDX-License-Identifier: Apache-2.0
// The sustained stream: the highest rate of sample indications a running kestreld forwards to
// the kernel side as type-2 frames with no loss, set against a bare relay that copies records
// from its simulator's socket to a netlink socket and does nothing else.
//
// A sweep offers indications from the simulator's side at rising rates, each for half a second,
// paced against the clock. A rate is forwarded without loss when every indication has become a
// frame at the kernel side and the last frame came no later than 20 ms after the last indication
// was due: the stream keeps up, no backlog builds. (The sockets on the way block rather than
// drop, so falling behind shows as a backlog, not as missing frames.) The sweep doubles the rate
// until a rate fails twice, then climbs from the last rate that passed in steps of an eighth.
//
// The daemon (port id 20000) sends to kernel port 100; the relay (an automatic port id) to 101.
// Each has a simulator of its own; both run side by side in the program's network namespace.
#include <errno.h>
#include <linux/netlink.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <cmath>
#include <memory>

#include "bench/bench_support.h"
#include "byte_order.h"
#include "kernel_frame.h"
#include "kestrel_platform.h"
#include "sensor1_messages.h"
#include "sensor1_wire.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_bench::FrameDrain;
using kestrel_driver::ChildProcess;

constexpr uint32_t kRelayKernelPort = 101;
constexpr double kTimeScale = 0.05;
constexpr double kWindowSeconds = 0.5;
constexpr int64_t kMaxLagNs = 20 * 1000 * 1000;
constexpr double kFirstRate = 2000;
constexpr double kMaxRate = 4e6;

// ---- The bare relay (run as a child process of this program) ----

// Reads records in chunks as the sensor1 library does and sends one 32-byte frame for each
// indication, its three words' low halves as the values: no conversion, no lock, no allocation.
int run_relay(const char* socket_path) {
  int32_t opened = 0;
  const int sim = sensor1_wire::connect_and_open(socket_path, 10, &opened);
  const int nl = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, platform_netlink_protocol());
  if (sim < 0 || nl < 0) {
    fprintf(stderr, "relay: cannot set up its sockets\n");
    return 1;
  }
  sockaddr_nl kernel;
  memset(&kernel, 0, sizeof kernel);
  kernel.nl_family = AF_NETLINK;
  kernel.nl_pid = kRelayKernelPort;
  std::vector<uint8_t> rx(64 * 1024);
  size_t have = 0;
  uint8_t frame[32];
  for (;;) {
    const ssize_t got = recv(sim, rx.data() + have, rx.size() - have, 0);
    if (got <= 0) return 0;
    have += static_cast<size_t>(got);
    size_t pos = 0;
    sensor1_wire::Record rec;
    for (long span; (span = sensor1_wire::parse(rx.data() + pos, have - pos, &rec)) > 0;
         pos += static_cast<size_t>(span)) {
      if (rec.kind != sensor1_wire::kIndication || rec.header.msg_size < 24) continue;
      memset(frame, 0, sizeof frame);
      nlmsghdr hdr;
      memset(&hdr, 0, sizeof hdr);
      hdr.nlmsg_len = sizeof frame;
      hdr.nlmsg_type = FRAME_SAMPLE;
      memcpy(frame, &hdr, sizeof hdr);
      for (int i = 0; i < 3; ++i) {
        store_u16(frame, 16 + 4 + 2 * i,
                  static_cast<uint16_t>(load_u32(rec.body, kSampleXOffset + 4 * i) & 0xffff));
      }
      sendto(nl, frame, sizeof frame, 0, reinterpret_cast<sockaddr*>(&kernel), sizeof kernel);
    }
    memmove(rx.data(), rx.data() + pos, have - pos);
    have -= pos;
  }
}

// ---- The sweep ----

struct Side {
  std::unique_ptr<kestrel_sim::Simulator> sim;
  std::unique_ptr<FrameDrain> kernel;
  std::unique_ptr<ChildProcess> process;
};

struct Setup {
  kestrel_driver::RunDir dir{"kestrel-bench"};
  Side daemon;
  Side relay;
  std::string error;
};

std::unique_ptr<Setup> g_setup;

Setup& setup() {
  if (g_setup) return *g_setup;
  g_setup = std::make_unique<Setup>();
  Setup& s = *g_setup;
  s.daemon.kernel = std::make_unique<FrameDrain>(kestrel_bench::kKernelPort, FRAME_SAMPLE);
  s.relay.kernel = std::make_unique<FrameDrain>(kRelayKernelPort, FRAME_SAMPLE);
  if (!s.daemon.kernel->ok() || !s.relay.kernel->ok()) {
    s.error = "the kernel side's netlink sockets could not be bound";
    return s;
  }
  const std::string daemon_socket = s.dir.file("daemon.sock");
  s.daemon.sim = std::make_unique<kestrel_sim::Simulator>(daemon_socket);
  s.daemon.process = std::make_unique<ChildProcess>(
      std::vector<std::string>{kestrel_bench::kestreld_binary()},
      kestrel_driver::daemon_environment(s.dir, daemon_socket, kTimeScale));
  const std::string relay_socket = s.dir.file("relay.sock");
  s.relay.sim = std::make_unique<kestrel_sim::Simulator>(relay_socket);
  s.relay.process = std::make_unique<ChildProcess>(
      std::vector<std::string>{kestrel_bench::self_binary(), "--relay=" + relay_socket},
      kestrel_driver::current_environment());
  // Up: connected, its start-up threads ended (within a second at this time scale), only its
  // main thread and the sensor1 library's thread left.
  if (!kestrel_driver::wait_up(
          s.daemon.process.get(), [&] { return s.daemon.sim->current_connection() != 0; }, 2,
          std::chrono::seconds(30)) ||
      !s.relay.sim->wait_for_connection(std::chrono::seconds(30))) {
    s.error = "kestreld or the relay did not connect to its simulator";
  }
  return s;
}

void teardown() {
  g_setup.reset();
}

void sleep_until_ns(int64_t t) {
  timespec ts;
  ts.tv_sec = t / 1000000000;
  ts.tv_nsec = t % 1000000000;
  while (clock_nanosleep(CLOCK_MONOTONIC, TIMER_ABSTIME, &ts, nullptr) == EINTR) {
  }
}

// Offers kWindowSeconds of sample indications at rate per second. True when every one became a
// frame at the kernel side and the last frame came within kMaxLagNs of the last one's due time.
bool offer(Side& side, double rate) {
  const std::vector<uint8_t> body =
      kestrel_sim::sample_indication_body(kSmgrAccel, 0, 3277, -2621, 642908);
  const kestrel_sim::Header header{kServiceSmgr, kMsgSmgrSample, 0, 0};
  const uint64_t total = static_cast<uint64_t>(rate * kWindowSeconds);
  const double period_ns = 1e9 / rate;
  const uint64_t before = side.kernel->count();
  const int64_t start = kestrel_bench::now_ns();
  uint64_t sent = 0;
  while (sent < total) {
    // Everything due by now goes out; then a sleep until the next one is due.
    const double elapsed = static_cast<double>(kestrel_bench::now_ns() - start);
    const uint64_t due = std::min<uint64_t>(total, static_cast<uint64_t>(elapsed / period_ns) + 1);
    while (sent < due) {
      side.sim->indicate(header, body);
      ++sent;
    }
    if (sent < total) sleep_until_ns(start + static_cast<int64_t>(sent * period_ns));
  }
  const int64_t last_due = start + static_cast<int64_t>((total - 1) * period_ns);
  if (!side.kernel->wait_for_count(before + total, std::chrono::seconds(10))) return false;
  return side.kernel->last_arrival_ns() - last_due <= kMaxLagNs;
}

// A rate counts as failed only when it fails twice in a row: one pass is enough.
bool passes(Side& side, double rate) {
  return offer(side, rate) || offer(side, rate);
}

double sweep(Side& side) {
  double passed = 0;
  double rate = kFirstRate;
  while (rate <= kMaxRate && passes(side, rate)) {
    passed = rate;
    rate *= 2;
  }
  if (passed == 0) return 0;
  for (double r = passed * 1.125; r < passed * 2 && passes(side, r); r *= 1.125) passed = r;
  return passed;
}

void run_sweep(benchmark::State& state, Side Setup::*side) {
  Setup& s = setup();
  if (!s.error.empty()) {
    state.SkipWithError(s.error.c_str());
    return;
  }
  double rate = 0;
  for (auto _ : state) {
    const int64_t start = kestrel_bench::now_ns();
    rate = sweep(s.*side);
    state.SetIterationTime(static_cast<double>(kestrel_bench::now_ns() - start) * 1e-9);
  }
  if (rate == 0) state.SkipWithError("not even the first rate was forwarded without loss");
  state.counters["lossless_rate"] = rate;
}

void BM_StreamDaemon(benchmark::State& state) {
  run_sweep(state, &Setup::daemon);
}
void BM_StreamBareRelay(benchmark::State& state) {
  run_sweep(state, &Setup::relay);
}

BENCHMARK(BM_StreamDaemon)
    ->Iterations(1)
    ->Repetitions(3)
    ->UseManualTime()
    ->Unit(benchmark::kSecond);
BENCHMARK(BM_StreamBareRelay)
    ->Iterations(1)
    ->Repetitions(3)
    ->UseManualTime()
    ->Unit(benchmark::kSecond);

void summarize(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  auto rate = [&](const std::string& name) { return counter(runs, name, "lossless_rate"); };
  const double daemon = rate("BM_StreamDaemon");
  const double bare = rate("BM_StreamBareRelay");
  summary->add({"sustained stream: highest lossless sample rate", format_number(daemon, 0) + " /s",
                "bare relay " + format_number(bare, 0) + " /s", format_ratio(daemon / bare), "-",
                "-"});
  summary->note(
      "Median of three sweeps each, the daemon's and the relay's interleaved. A rate "
      "passes when every indication arrives as a frame and the last comes within 20 ms "
      "of its due time; steps of an eighth above the last doubling that passed.");
  summary->note(
      "Per sample the daemon's library thread copies the record, allocates the body, "
      "runs the callback (indication_lock, conversion, the four blocks of "
      "send_to_kernel, one sendmsg) and frees the body; the relay only sends.");
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && strncmp(argv[1], "--relay=", 8) == 0) return run_relay(argv[1] + 8);
  kestrel_bench::enter_private_network_namespace(argc, argv);
  return kestrel_bench::run_benchmarks(argc, argv, "Sustained stream", summarize, teardown);
}
