// The command round trip: an accelerometer self test (command 8, sensor_type 0) sent from the
// kernel side through a running kestreld and an in-process kestrel_sim::Simulator playing the
// healthy phone, until the type-9 reply is back; set against a bare ping-pong over the same hops
// without the daemon: a netlink datagram to a trivial relay process, one record on a Unix stream
// socket to a Simulator and one back, and a netlink datagram back to the kernel side.
//
// Further relays add the duties of the daemon's design to the bare ping-pong, one at a time and
// all together, to measure what each costs:
//   - log lines: the daemon's log lines of a self test, at the same points, through liblog's
//     stderr logger (stderr on /dev/null, as the daemon's);
//   - hand-over: a reader thread takes the records and hands the indication to the main thread
//     waiting on a condition variable, as the sensor1 library's thread hands it to the command
//     waiting on command_waiter;
//   - response record: the simulator answers with a response and then the indication, as the
//     sensor service answers a self test.
//
// Everything runs side by side in the program's own network namespace: the daemon on its port
// id 20000 with the kernel side on 100, relay i on 20001 + i with its kernel side on 101 + i.
#include <errno.h>
#include <linux/netlink.h>
#include <poll.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <cmath>
#include <memory>

#include "bench/bench_support.h"
#include "byte_order.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"
#include "sensor1_messages.h"
#include "sensor1_wire.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_bench::ChildProcess;
using kestrel_bench::NetlinkPort;

// Start-up delays of the daemon, 5 s and more, at a twentieth.
constexpr double kTimeScale = 0.05;
constexpr auto kReplyTimeout = std::chrono::seconds(5);

// Words of a passing accelerometer self test.
const std::vector<int32_t> kAccelWords = {0, 1, 0, 0, 0, 0, 0, 0};

// The daemon's duties that a relay can take on.
enum Duty : unsigned {
  kLogLines = 1,
  kHandOver = 2,
  kResponseRecord = 4,
};

struct Relay {
  const char* name;
  unsigned duties;
  const char* description;
};

constexpr Relay kRelays[] = {
    {"BarePingPong", 0, "bare ping-pong"},
    {"BareWithLogLines", kLogLines, "bare ping-pong + the daemon's log lines"},
    {"BareWithHandOver", kHandOver, "bare ping-pong + the thread hand-over"},
    {"BareWithResponseRecord", kResponseRecord, "bare ping-pong + the response record"},
    {"BareWithAllDuties", kLogLines | kHandOver | kResponseRecord,
     "bare ping-pong + all three duties"},
};
constexpr size_t kRelayCount = sizeof kRelays / sizeof kRelays[0];
constexpr size_t kAllDuties = kRelayCount - 1;

uint32_t relay_port(size_t i) {
  return 20001 + static_cast<uint32_t>(i);
}
uint32_t relay_kernel_port(size_t i) {
  return 101 + static_cast<uint32_t>(i);
}

// ---- The relays (each runs as a child process of this program) ----

// WRITE of the 12-byte self-test request (SensorID 0, TestType 6), as the daemon writes it.
std::vector<uint8_t> write_record() {
  uint8_t request[12] = {};
  store_u32(request, 4, 6);
  return sensor1_wire::encode(sensor1_wire::message(
      sensor1_wire::kWrite, {kServiceSmgr, kMsgSmgrSingleSensorTest, 0, kTxnSingleSensorTest},
      request, sizeof request));
}

// Reads whole records from the simulator and keeps the words of the latest indication.
class RecordReader {
 public:
  explicit RecordReader(int fd) : fd_(fd), rx_(64 * 1024) {}
  // Reads what the socket holds (waiting for it when block is set) and returns true once an
  // indication has been taken; responses are passed over, as the daemon's callback passes over a
  // successful self-test response. Ends the process when the simulator goes away.
  bool read(bool block, bool log_lines) {
    const ssize_t got = recv(fd_, rx_.data() + have_, rx_.size() - have_, block ? 0 : MSG_DONTWAIT);
    if (got <= 0) {
      if (got < 0 && (errno == EAGAIN || errno == EINTR)) return false;
      _exit(0);
    }
    have_ += static_cast<size_t>(got);
    bool indication = false;
    size_t pos = 0;
    sensor1_wire::Record rec;
    for (long span; (span = sensor1_wire::parse(rx_.data() + pos, have_ - pos, &rec)) > 0;
         pos += static_cast<size_t>(span)) {
      if (rec.kind == sensor1_wire::kIndication && rec.header.msg_size >= 84) {
        memcpy(words, rec.body + kTestIndWordsOffset, sizeof words);
        if (log_lines) log_callback_lines(rec.body);
        indication = true;
      }
    }
    memmove(rx_.data(), rx_.data() + pos, have_ - pos);
    have_ -= pos;
    return indication;
  }

  uint8_t words[32] = {};

 private:
  // The service callback's lines for a passed test indication.
  static void log_callback_lines(const uint8_t* body) {
    const uint8_t* w = body + kTestIndWordsOffset;
    KLOGI("%s, SensorID:%d, TestType:%d", "rcv_test_msg", body[kTestIndSensorIdOffset],
          load_i32(body, kTestIndTestTypeOffset));
    KLOGI(
        "%s: Registers Received test Passed1: %i, %d, %d, %d, %d, %d, %d, %d, %d, %d, %d, %d, %d, "
        "%d, %d",
        "rcv_test_msg", 0, load_i32(w, 0), load_i32(w, 4), load_i32(w, 8), load_i32(w, 12),
        load_i32(w, 16), load_i32(w, 20), load_i32(w, 24), load_i32(w, 28), load_i32(w, 32),
        load_i32(w, 36), load_i32(w, 40), load_i32(w, 44), load_i32(w, 48), load_i32(w, 52));
    KLOGI("%s: result - %d\n", "rcv_complete", 0);
  }

  int fd_;
  std::vector<uint8_t> rx_;
  size_t have_ = 0;
};

// The hand-over from the reader thread to the main thread, as command_waiter does it.
struct HandOver {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  pthread_cond_t cond = PTHREAD_COND_INITIALIZER;
  bool arrived = false;
  uint8_t words[32] = {};
  RecordReader* reader = nullptr;
  int fd = -1;
  bool log_lines = false;
};

// The sensor1 library's part: wait for the socket, read what is there, and raise the waiter for
// each indication.
void* hand_over_reader(void* arg) {
  HandOver* h = static_cast<HandOver*>(arg);
  for (;;) {
    pollfd p = {h->fd, POLLIN, 0};
    if (poll(&p, 1, -1) <= 0) continue;
    if (!h->reader->read(/*block=*/false, h->log_lines)) continue;
    pthread_mutex_lock(&h->mutex);
    memcpy(h->words, h->reader->words, sizeof h->words);
    h->arrived = true;
    pthread_cond_signal(&h->cond);
    pthread_mutex_unlock(&h->mutex);
  }
  return nullptr;
}

// Waits for the hand-over with the daemon's 8-second deadline on the wall clock and copies the
// words out.
void wait_for_hand_over(HandOver* h, uint8_t (&words)[32]) {
  timeval now;
  gettimeofday(&now, nullptr);
  timespec deadline = {now.tv_sec + 8, now.tv_usec * 1000};
  pthread_mutex_lock(&h->mutex);
  while (!h->arrived && pthread_cond_timedwait(&h->cond, &h->mutex, &deadline) == 0) {
  }
  h->arrived = false;
  memcpy(words, h->words, sizeof words);
  pthread_mutex_unlock(&h->mutex);
}

// The type-9 reply from the indication's first eight result words.
void build_reply(uint32_t port, const uint8_t (&words)[32], uint8_t (&reply)[16 + 72]) {
  memset(reply, 0, sizeof reply);
  nlmsghdr hdr;
  memset(&hdr, 0, sizeof hdr);
  hdr.nlmsg_len = sizeof reply;
  hdr.nlmsg_type = FRAME_SELFTEST;
  hdr.nlmsg_pid = port;
  memcpy(reply, &hdr, sizeof hdr);
  memcpy(reply + 16 + 4, words, sizeof words);
}

// Relay i: take the datagram, write one record, wait for the indication, send the reply. With no
// duties that is all: no threads, no logging, no allocation per command.
int run_relay(size_t i, const char* socket_path) {
  const unsigned duties = kRelays[i].duties;
  const bool log_lines = (duties & kLogLines) != 0;
  int32_t opened = 0;
  const int sim = sensor1_wire::connect_and_open(socket_path, 10, &opened);
  const int nl = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, platform_netlink_protocol());
  sockaddr_nl own;
  memset(&own, 0, sizeof own);
  own.nl_family = AF_NETLINK;
  own.nl_pid = relay_port(i);
  if (sim < 0 || nl < 0 || bind(nl, reinterpret_cast<sockaddr*>(&own), sizeof own) != 0) {
    fprintf(stderr, "relay: cannot set up its sockets\n");
    return 1;
  }
  sockaddr_nl kernel;
  memset(&kernel, 0, sizeof kernel);
  kernel.nl_family = AF_NETLINK;
  kernel.nl_pid = relay_kernel_port(i);

  static RecordReader reader(sim);
  static HandOver hand_over;
  if ((duties & kHandOver) != 0) {
    hand_over.reader = &reader;
    hand_over.fd = sim;
    hand_over.log_lines = log_lines;
    pthread_t thread;
    if (pthread_create(&thread, nullptr, hand_over_reader, &hand_over) != 0) return 1;
  }
  uint8_t datagram[1024];
  const std::vector<uint8_t> request = write_record();
  uint8_t words[32];
  uint8_t reply[16 + 72];
  int32_t previous = 0;
  for (;;) {
    if (log_lines) KLOGI("%s: do while start = %d\n", "main", previous);
    const ssize_t n = recv(nl, datagram, sizeof datagram, 0);
    previous = static_cast<int32_t>(n);
    if (log_lines) KLOGE("left = %d", static_cast<int>(n));
    if (n < 16) continue;
    if (log_lines) {
      KLOGI("%s: %d", "process_message", load_u16(datagram, 4));
      KLOGI("%s: sensor_type = %d, id = %d\n", "get_selftest_result", 0, 0);
      KLOGI("%s: LSM6DSM ACCEL SELFTEST, TestType = (%d)\n", "get_selftest_result", 6);
      KLOGI("%s: msg_hdr.msg_id = 0x%x, id = %u\n", "get_selftest_result", 13, 0u);
    }
    if (!sensor1_wire::send_all(sim, request.data(), request.size())) {
      return 1;
    }
    if (log_lines) KLOGI("waiting for response IN - timeout=%d", 8000);
    if ((duties & kHandOver) != 0) {
      wait_for_hand_over(&hand_over, words);
    } else {
      while (!reader.read(/*block=*/true, log_lines)) {
      }
      memcpy(words, reader.words, sizeof words);
    }
    if (log_lines) KLOGI("%s: response received.", "wait_for_response");
    build_reply(relay_port(i), words, reply);
    sendto(nl, reply, sizeof reply, 0, reinterpret_cast<sockaddr*>(&kernel), sizeof kernel);
  }
}

// ---- The benchmarks ----

struct RelaySide {
  std::unique_ptr<NetlinkPort> kernel;
  std::unique_ptr<ChildProcess> process;
};

struct Setup {
  kestrel_bench::TempDir dir;
  // The daemon and its healthy phone.
  std::unique_ptr<kestrel_sim::Simulator> phone;
  std::unique_ptr<NetlinkPort> kernel;
  std::unique_ptr<ChildProcess> daemon;
  // The relays' simulators: the indication alone, or a response first.
  std::unique_ptr<kestrel_sim::Simulator> echo;
  std::unique_ptr<kestrel_sim::Simulator> echo_with_response;
  RelaySide relays[kRelayCount];
  std::string error;
};

std::unique_ptr<Setup> g_setup;

kestrel_sim::Simulator* relay_simulator(Setup& s, size_t i) {
  return (kRelays[i].duties & kResponseRecord) != 0 ? s.echo_with_response.get() : s.echo.get();
}

Setup& setup() {
  if (g_setup) return *g_setup;
  g_setup = std::make_unique<Setup>();
  Setup& s = *g_setup;
  s.kernel = std::make_unique<NetlinkPort>(kestrel_bench::kKernelPort);
  bool bound = s.kernel->ok();
  for (size_t i = 0; i < kRelayCount; ++i) {
    s.relays[i].kernel = std::make_unique<NetlinkPort>(relay_kernel_port(i));
    bound = bound && s.relays[i].kernel->ok();
  }
  if (!bound) {
    s.error = "the kernel side's netlink sockets could not be bound";
    return s;
  }

  const std::string phone_socket = s.dir.file("phone.sock");
  s.phone = std::make_unique<kestrel_sim::Simulator>(phone_socket, /*healthy=*/true);
  s.daemon = std::make_unique<ChildProcess>(
      std::vector<std::string>{kestrel_bench::kestreld_binary()},
      kestrel_bench::daemon_env(s.dir, phone_socket, kestrel_bench::kKernelPort, kTimeScale),
      s.dir.bin());

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
  for (size_t i = 0; i < kRelayCount; ++i) {
    kestrel_sim::Simulator* sim = relay_simulator(s, i);
    const int opened = sim->opened_connections();
    s.relays[i].process = std::make_unique<ChildProcess>(
        std::vector<std::string>{kestrel_bench::self_binary(),
                                 "--relay=" + std::to_string(i) + "," + sim->socket_path()},
        std::map<std::string, std::string>{});
    if (!kestrel_bench::wait_until([&] { return sim->opened_connections() > opened; },
                                   std::chrono::seconds(10))) {
      s.error = "a relay did not connect to its simulator";
      return s;
    }
  }

  // The daemon is ready once it has connected to the phone and its refresh thread has sent its
  // frame; then only its lasting threads (main and the sensor1 library's) are left.
  std::vector<uint8_t> frame;
  if (!s.phone->wait_for_connection(std::chrono::seconds(30))) {
    s.error = "kestreld did not connect to the simulator";
  } else if (!s.kernel->receive_type(FRAME_HH_REFRESH, std::chrono::seconds(30), &frame)) {
    s.error = "kestreld's refresh frame did not come";
  } else {
    const pid_t pid = s.daemon->pid();
    kestrel_bench::wait_until([&] { return kestrel_bench::process_thread_count(pid) <= 2; },
                              std::chrono::seconds(20));
  }
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
  const int64_t cpu_before = kestrel_bench::process_cpu_ns(measured);
  const long blocks_before = kestrel_bench::process_voluntary_switches(measured);
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
  const int64_t cpu_after = kestrel_bench::process_cpu_ns(measured);
  const long blocks_after = kestrel_bench::process_voluntary_switches(measured);
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
  run_round_trips(state, s.relays[i].kernel.get(), relay_port(i), relay_simulator(s, i),
                  s.relays[i].process->pid());
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

// ---- Log records of one self test ----

// Counted on a daemon of its own whose stderr goes to a file.
double g_records_per_command = std::nan("");

size_t count_log_records(const std::string& path) {
  FILE* f = fopen(path.c_str(), "r");
  if (f == nullptr) return 0;
  // A record starts "<tag> <priority letter> <MM-DD> ..."; a message's own newlines continue it.
  size_t records = 0;
  char line[4096];
  while (fgets(line, sizeof line, f) != nullptr) {
    const char* space = strchr(line, ' ');
    if (space != nullptr && space != line && space[1] != '\0' &&
        strchr("VDIWEF", space[1]) != nullptr && space[2] == ' ' && space[3] >= '0' &&
        space[3] <= '9') {
      ++records;
    }
  }
  fclose(f);
  return records;
}

void count_records_per_command(Setup& s) {
  constexpr int kCommands = 20;
  s.daemon.reset();
  const int opened = s.phone->opened_connections();
  const std::string log = s.dir.file("kestreld.log");
  ChildProcess daemon(std::vector<std::string>{kestrel_bench::kestreld_binary()},
                      kestrel_bench::daemon_env(s.dir, s.phone->socket_path(),
                                                kestrel_bench::kKernelPort, kTimeScale),
                      s.dir.bin(), log);
  std::vector<uint8_t> frame;
  if (!kestrel_bench::wait_until([&] { return s.phone->opened_connections() > opened; },
                                 std::chrono::seconds(30)) ||
      !s.kernel->receive_type(FRAME_HH_REFRESH, std::chrono::seconds(30), &frame)) {
    return;
  }
  const pid_t pid = daemon.pid();
  kestrel_bench::wait_until([&] { return kestrel_bench::process_thread_count(pid) <= 2; },
                            std::chrono::seconds(20));
  const std::vector<uint8_t> command = kestrelctl::build_command(NETLINK_MESSAGE_SELFTEST, {0});
  // The receive loop's line after a command comes once the reply is out: a pause after the
  // first (uncounted) command and after the last lets every line reach the file.
  if (!round_trip(s.kernel.get(), kestrel_bench::kDaemonPort, command, &frame)) return;
  usleep(100 * 1000);
  const size_t before = count_log_records(log);
  for (int i = 0; i < kCommands; ++i) {
    if (!round_trip(s.kernel.get(), kestrel_bench::kDaemonPort, command, &frame)) return;
  }
  usleep(100 * 1000);
  const size_t after = count_log_records(log);
  g_records_per_command = static_cast<double>(after - before) / kCommands;
}

void teardown() {
  if (g_setup && g_setup->error.empty()) count_records_per_command(*g_setup);
  g_setup.reset();
}

// ---- Summary ----

void summarize(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  auto counter = [&](const std::string& name, const std::string& key) {
    auto it = runs.find(name);
    if (it == runs.end()) return std::nan("");
    auto c = it->second.counters.find(key);
    return c == it->second.counters.end() ? std::nan("") : median(c->second);
  };
  auto mean = [&](const std::string& name) {
    auto it = runs.find(name);
    return it == runs.end() ? std::nan("") : median(it->second.real_ns);
  };
  const std::string kDaemon = "BM_SelftestRoundTripDaemon";
  const std::string kBare = relay_benchmark(0);
  const std::string kDuties = relay_benchmark(kAllDuties);

  const double daemon = counter(kDaemon, "p50_ns");
  const double bare = counter(kBare, "p50_ns");
  const double ratio = daemon / bare;
  summary->add({"command round trip: self test (command 8), median", format_ns(daemon),
                "bare ping-pong over the same hops " + format_ns(bare), format_ratio(ratio),
                "<= 2x", verdict(ratio <= 2.0, !std::isnan(ratio))});
  summary->add({"  the same, mean", format_ns(mean(kDaemon)),
                "bare ping-pong " + format_ns(mean(kBare)),
                format_ratio(mean(kDaemon) / mean(kBare)), "-", "-"});
  for (size_t i = 1; i < kRelayCount; ++i) {
    const double relay = counter(relay_benchmark(i), "p50_ns");
    summary->add({std::string("  ") + kRelays[i].description + ", median", format_ns(relay),
                  "bare ping-pong " + format_ns(bare), format_ratio(relay / bare), "-", "-"});
  }
  const double duties = counter(kDuties, "p50_ns");
  summary->add({"  kestreld against the bare ping-pong with all three duties", format_ns(daemon),
                "with the duties " + format_ns(duties), format_ratio(daemon / duties), "-", "-"});

  const double daemon_cpu = counter(kDaemon, "process_cpu_ns");
  const double relay_cpu = counter(kBare, "process_cpu_ns");
  const double duty_cpu = counter(kDuties, "process_cpu_ns");
  summary->add({"CPU time of kestreld per self test", format_ns(daemon_cpu),
                "bare relay " + format_ns(relay_cpu), format_ratio(daemon_cpu / relay_cpu), "-",
                "-"});
  summary->add({"  the same, against the relay with all three duties", format_ns(daemon_cpu),
                "relay with the duties " + format_ns(duty_cpu), format_ratio(daemon_cpu / duty_cpu),
                "-", "-"});
  const double daemon_blocks = counter(kDaemon, "blocked_per_command");
  summary->add(
      {"times a thread of kestreld blocked, per self test", format_number(daemon_blocks, 1),
       "bare relay " + format_number(counter(kBare, "blocked_per_command"), 1) +
           ", relay with the duties " + format_number(counter(kDuties, "blocked_per_command"), 1),
       "-", "-", "-"});
  summary->add({"log records written per self test", format_number(g_records_per_command, 1), "-",
                "-", "-", "-"});
  summary->note(
      "Median: the median latency of the commands of a repetition, then the median "
      "over the repetitions; mean: the mean per command, median over the repetitions. "
      "All runs were interleaved.");
  summary->note(
      "The duties, added to the bare ping-pong: the daemon's log lines of a self test "
      "through liblog's stderr logger; the hand-over from a reader thread to the main "
      "thread waiting on a condition variable; a response record before the "
      "indication.");
  summary->note(
      "CPU time: the run time of all threads of the process over the timed commands, "
      "per command.");
}

}  // namespace

int main(int argc, char** argv) {
  // Relay i, started by the benchmarks: --relay=<i>,<simulator socket>.
  if (argc == 2 && strncmp(argv[1], "--relay=", 8) == 0) {
    char* end = nullptr;
    const unsigned long i = strtoul(argv[1] + 8, &end, 10);
    if (i >= kRelayCount || *end != ',') return 2;
    return run_relay(i, end + 1);
  }
  kestrel_bench::enter_private_network_namespace(argc, argv);
  register_benchmarks();
  return kestrel_bench::run_benchmarks(argc, argv, "Command round trip", summarize, teardown);
}
