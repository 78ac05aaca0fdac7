// SPDX-License-Identifier: Apache-2.0
// kestrel-soak: runs kestreld for a long stretch of work and checks that nothing accumulates.
//
// The daemon runs as a child process (meant to be started inside a private network namespace,
// as scripts/soak.sh does); this program plays the kernel factory driver on netlink port 100 and
// the sensor processor with an in-process simulator that answers like a healthy phone. It feeds
// the daemon sample indications through the real sensor1 socket and kernel commands of every
// kind the daemon serves, counts every frame that comes back, and measures the daemon's resident
// memory, open descriptors and threads once the first tenth of the work is done and again at the
// end. With --valgrind the daemon runs under memcheck and the leak summary is checked as well.
//
// The run ends through the daemon's own exit path: a write failure whose close fails makes it
// exit with the close's result, which valgrind --error-exitcode=1 replaces by 1 when it found
// errors. The figures go to stdout; the exit status is 0 when every check held.
#include <ctype.h>
#include <stdio.h>
#include <stdlib.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <fstream>
#include <functional>
#include <memory>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "frame_codec.h"
#include "frame_decoder.h"
#include "kernel_frame.h"
#include "kernel_port.h"
#include "tools/sim/simulator.h"
#include "tools/soak/command_cycle.h"
#include "tools/soak/daemon_driver.h"
#include "tools/soak/proc_readings.h"
#include "tools/soak/tool_main.h"
#include "tools/soak/verdicts.h"

#ifndef KESTRELD_BINARY
#error "KESTRELD_BINARY names the daemon to soak"
#endif

namespace {

using namespace kestrel_driver;

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

constexpr int kExitStatus = 77;  // the close result that ends the run
// Injected samples in flight (sent to the daemon, frame not yet back) at most.
constexpr long kInjectWindow = 2000;
// The injected sample: a gyroscope reading the daemon turns into {-61, 61, -30}.
constexpr uint8_t kInjectSensor = 10;
constexpr int32_t kInjectX = 1000, kInjectY = -1000, kInjectZ = 500;
constexpr char kInjectedValues[] = "[-61,61,-30,";
// The daemon's log lines counted: failures, and an indication that came before its waiter.
constexpr char kEarlyCallback[] = "cb has arrived without waiting";
const std::vector<std::string> kLogPatterns = {
    kEarlyCallback,
    "ERROR: No response for command",
    "sensor1_write -error",
    "sensor1_write error",
    "alloc_msg_buf error",
    "get_raw error",
    "BROKEN_PIPE",
    "malformed",
    "refused",
};

struct Options {
  long indications = 1000000;
  long commands = 100000;
  double time_scale = 0.05;
  double warmup = 0.1;
  double rss_tolerance = 0.01;
  std::string daemon = KESTRELD_BINARY;
  std::string registry;
  bool valgrind = false;
  std::string suppressions;
  std::string valgrind_log;
};

bool parse_options(int argc, char** argv, Options* o) {
  const std::vector<ToolOption> options = {
      {"--indications", "N", "sample indications to feed (default 1000000)",
       [o](const char* v) { o->indications = atol(v); }},
      {"--commands", "N", "kernel commands to send (default 100000)",
       [o](const char* v) { o->commands = atol(v); }},
      {"--time-scale", "X", "KESTREL_TIME_SCALE of the daemon (default 0.05)",
       [o](const char* v) { o->time_scale = atof(v); }},
      {"--registry", "FILE", "sensors registry for command 4 (default: none)",
       [o](const char* v) { o->registry = v; }},
      {"--daemon", "PATH", "the daemon (default: the one built beside this program)",
       [o](const char* v) { o->daemon = v; }},
      {"--valgrind", nullptr, "run the daemon under valgrind memcheck",
       [o](const char*) { o->valgrind = true; }},
      {"--suppressions", "FILE", "valgrind suppressions",
       [o](const char* v) { o->suppressions = v; }},
      {"--valgrind-log", "FILE", "where valgrind writes (default: a temporary file)",
       [o](const char* v) { o->valgrind_log = v; }},
  };
  return parse_tool_options(
             argc, argv,
             "usage: kestrel-soak [options]   (run it in a network namespace of its own)",
             options) &&
         o->indications >= 0 && o->commands >= 10 && o->time_scale > 0;
}

// The commands one after the other, cycle after cycle.
class CommandStream {
 public:
  const Planned& next() {
    if (position_ == current_.size()) {
      current_ = cycle(++cycle_);
      position_ = 0;
    }
    return current_[position_++];
  }

 private:
  long cycle_ = -1;
  std::vector<Planned> current_;
  size_t position_ = 0;
};

// ---------------------------------------------------------------------------------------------
// The kernel's side: frames counted by type, samples told apart by their content.

struct Tally {
  std::array<std::atomic<long>, 64> frames{};  // by frame type (types above 63 in other)
  std::atomic<long> other{0};
  std::atomic<long> injected{0};     // type 2 frames of the injected sample
  std::atomic<long> stream{0};       // type 2 frames of the healthy phone's streams
  std::atomic<long> odd_samples{0};  // type 2 frames of neither
  std::atomic<long> unanswered{0};   // replies that say no answer came, or a failed test
  std::atomic<long> overruns{0};
};

// The field of each reply that tells whether the healthy phone answered, and its value then.
struct AnsweredReply {
  uint16_t type;
  const char* field;
  const char* answered;
};
constexpr AnsweredReply kAnsweredReplies[] = {
    {FRAME_STATUS, "no_response", "0"},           {FRAME_STORE_CALIBRATION, "result", "0"},
    {FRAME_MAG_FUSE_ROM, "result", "0"},          {FRAME_MAG_REGISTERS, "result", "0"},
    {FRAME_SELFTEST, "verdict", "\"PASS\""},  // every healthy self test passes
    {FRAME_GYRO_SELFTEST, "verdict", "\"PASS\""},
};

// The JSON value of a decoded field, "" when the frame has none.
std::string field(const kestrelctl::DecodedFrame& d, const std::string& name) {
  for (const kestrelctl::Field& f : d.fields) {
    if (f.name == name && f.in_json) return f.json;
  }
  return "";
}

void count_sample(const kestrelctl::DecodedFrame& d, Tally* t) {
  const std::string code = field(d, "code");
  if (code == "1" && field(d, "values").rfind(kInjectedValues, 0) == 0) {
    ++t->injected;
  } else if (code == "0" || code == "4" || code == "5") {
    ++t->stream;
  } else {
    ++t->odd_samples;
  }
}

void count_frame(const kestrelctl::Frame& f, Tally* t) {
  if (f.malformed || f.type >= t->frames.size()) {
    ++t->other;
    return;
  }
  ++t->frames[f.type];
  const kestrelctl::DecodedFrame d = kestrelctl::decode_frame(f);
  if (f.type == FRAME_SAMPLE) count_sample(d, t);
  for (const AnsweredReply& r : kAnsweredReplies) {
    if (r.type == f.type && field(d, r.field) != r.answered) ++t->unanswered;
  }
}

// ---------------------------------------------------------------------------------------------

struct ValgrindSummary {
  bool found = false;
  long errors = -1;
  long definitely = -1, indirectly = -1, possibly = -1, suppressed_leaks = 0;
  long suppressed_errors = 0;
};

// The number that follows the last occurrence of label in text ("1,234" counts as 1234), or -1.
long number_after(const std::string& text, const std::string& label) {
  const size_t at = text.rfind(label);
  if (at == std::string::npos) return -1;
  std::string digits;
  for (size_t i = at + label.size(); i < text.size(); ++i) {
    const char c = text[i];
    if (isdigit(static_cast<unsigned char>(c))) {
      digits += c;
    } else if (!(c == ',' && !digits.empty()) && !(c == ' ' && digits.empty())) {
      break;
    }
  }
  return digits.empty() ? -1 : atol(digits.c_str());
}

ValgrindSummary read_valgrind_log(const std::string& path) {
  std::ifstream in(path);
  std::stringstream ss;
  ss << in.rdbuf();
  const std::string text = ss.str();
  ValgrindSummary s;
  const size_t summary = text.rfind("ERROR SUMMARY:");
  if (summary == std::string::npos) return s;
  s.found = true;
  const std::string errors = text.substr(summary, text.find('\n', summary) - summary);
  s.errors = number_after(errors, "ERROR SUMMARY:");
  s.suppressed_errors = std::max(0L, number_after(errors, "(suppressed:"));
  if (text.find("All heap blocks were freed -- no leaks are possible") != std::string::npos) {
    s.definitely = s.indirectly = s.possibly = 0;
    return s;
  }
  const size_t leaks = text.rfind("LEAK SUMMARY:");
  if (leaks == std::string::npos) return s;
  const std::string block = text.substr(leaks, summary - leaks);
  s.definitely = number_after(block, "definitely lost:");
  s.indirectly = number_after(block, "indirectly lost:");
  s.possibly = number_after(block, "possibly lost:");
  s.suppressed_leaks = std::max(0L, number_after(block, "suppressed:"));
  return s;
}

// The figures of valgrind's log and their checks.
void check_valgrind(const std::string& log,
                    const std::function<bool(bool, const std::string&)>& check) {
  const ValgrindSummary v = read_valgrind_log(log);
  printf(
      "soak: valgrind: %ld errors (%ld suppressed); definitely lost %ld, indirectly lost %ld, "
      "possibly lost %ld bytes; %ld bytes in suppressed leaks\n",
      v.errors, v.suppressed_errors, v.definitely, v.indirectly, v.possibly, v.suppressed_leaks);
  printf("soak: valgrind log: %s\n", log.c_str());
  check(v.found && v.errors == 0, "valgrind: ERROR SUMMARY 0 errors");
  check(v.definitely == 0 && v.indirectly == 0 && v.possibly == 0,
        "valgrind: definitely, indirectly and possibly lost 0 bytes");
}

struct Figures {
  ProcessStatus warm, end;
  double seconds = 0;
  int status = 0;
  double rss_growth() const {
    return warm.rss_kib > 0
               ? static_cast<double>(end.rss_kib - warm.rss_kib) / static_cast<double>(warm.rss_kib)
               : 1.0;
  }
};

class Soak {
 public:
  explicit Soak(const Options& o)
      : o_(o), dir_("kestrel-soak"), log_(dir_.file("kestreld.log"), kLogPatterns) {
    if (o_.valgrind && o_.valgrind_log.empty()) o_.valgrind_log = dir_.file("valgrind.log");
  }

  int run();

 private:
  bool start();
  bool work(Figures* f);
  int end_through_exit_path();
  void stop_receiving();
  void receive_frames();
  void send_commands(long count);
  void inject(long from, long to);
  bool wait_quiet(std::chrono::seconds timeout);
  bool daemon_ended() { return daemon_->wait_exit(0ms); }
  void report_failure(const std::string& what);
  bool check(bool ok, const std::string& what) { return verdicts_.check(ok, what); }
  void print_figures(const Figures& f);
  void check_figures(const Figures& f);

  Options o_;
  RunDir dir_;
  DaemonLog log_;
  std::unique_ptr<kestrel_sim::Simulator> sim_;
  kestrelctl::KernelPort rx_, tx_;
  std::unique_ptr<ChildProcess> daemon_;
  std::thread receiver_;
  std::atomic<bool> stop_{false};
  Tally tally_;
  CommandStream commands_;
  std::array<std::atomic<long>, 64> expected_{};
  std::atomic<long> injected_sent_{0};
  std::atomic<long> inject_failures_{0};
  std::atomic<long> send_failures_{0};
  Verdicts verdicts_{"soak", 62};
};

void Soak::report_failure(const std::string& what) {
  fprintf(stderr, "soak: %s\n", what.c_str());
  log_.print_last("soak");
  verdicts_.miss();
}

void Soak::receive_frames() {
  std::vector<kestrelctl::Frame> frames;
  while (!stop_.load()) {
    frames.clear();
    if (rx_.receive(100, &frames, nullptr) == kestrelctl::KernelPort::Wait::kOverrun) {
      ++tally_.overruns;
    }
    for (const kestrelctl::Frame& f : frames) count_frame(f, &tally_);
  }
}

void Soak::stop_receiving() {
  stop_ = true;
  if (receiver_.joinable()) receiver_.join();
}

void Soak::send_commands(long count) {
  for (long i = 0; i < count; ++i) {
    const Planned& p = commands_.next();
    if (p.reply >= 0) ++expected_[static_cast<size_t>(p.reply)];
    // Blocking: when the daemon's queue is full this waits for it.
    if (!tx_.send(p.datagram)) ++send_failures_;
  }
}

void Soak::inject(long from, long to) {
  const std::vector<uint8_t> body =
      kestrel_sim::sample_indication_body(kInjectSensor, 0, kInjectX, kInjectY, kInjectZ);
  const kestrel_sim::Header header{0, 3, 0, 0};
  const int connection = sim_->current_connection();
  for (long i = from; i < to; ++i) {
    // At most a window of samples on their way, so no queue on the road grows without bound.
    for (int spins = 1; injected_sent_.load() - tally_.injected.load() >= kInjectWindow; ++spins) {
      if (spins % 1000 == 0 && daemon_ended()) return;
      std::this_thread::sleep_for(100us);
    }
    ++injected_sent_;
    if (!sim_->indicate_to(connection, header, body)) ++inject_failures_;
  }
}

bool Soak::wait_quiet(std::chrono::seconds timeout) {
  const auto deadline = Clock::now() + timeout;
  for (;;) {
    bool done = tally_.injected.load() + tally_.odd_samples.load() >= injected_sent_.load();
    for (size_t t = 0; t < expected_.size() && done; ++t) {
      if (t == FRAME_HH_REFRESH || t == FRAME_SAMPLE) continue;
      done = tally_.frames[t].load() >= expected_[t].load();
    }
    if (done) {
      // Whatever was still on its way has arrived; a short pause lets a straggler show up.
      std::this_thread::sleep_for(200ms);
      return true;
    }
    if (Clock::now() >= deadline || daemon_ended()) return false;
    std::this_thread::sleep_for(20ms);
  }
}

// The simulator, the kernel's ports and the daemon, until the daemon is ready.
bool Soak::start() {
  const std::string socket_path = dir_.file("sensor1.sock");
  if (dir_.ok()) sim_ = std::make_unique<kestrel_sim::Simulator>(socket_path, true);
  if (!dir_.ok() || !sim_->listening() || !rx_.open_bound(kKernelPort) || !tx_.open_unbound()) {
    fprintf(stderr, "soak: cannot open the sockets (run it in a network namespace of its own)\n");
    return false;
  }
  receiver_ = std::thread([this] { receive_frames(); });
  std::vector<std::string> args;
  if (o_.valgrind) {
    args = {"valgrind", "--leak-check=full", "--error-exitcode=1", "--log-file=" + o_.valgrind_log};
    if (!o_.suppressions.empty()) args.push_back("--suppressions=" + o_.suppressions);
  }
  args.push_back(o_.daemon);
  daemon_ = std::make_unique<ChildProcess>(
      args, daemon_environment(dir_, socket_path, o_.time_scale, o_.registry), log_.path());
  printf("soak: %s%s, %ld sample indications, %ld commands of %d kinds, time scale %g\n",
         o_.valgrind ? "valgrind memcheck on " : "", o_.daemon.c_str(), o_.indications, o_.commands,
         kCommandKinds, o_.time_scale);
  // Up: the start-up thread has opened the service and both start-up threads have ended.
  if (!wait_up(
          daemon_.get(), [&] { return sim_->current_connection() != 0; }, 2,
          o_.valgrind ? 120s : 30s)) {
    report_failure("the daemon did not come up");
    return false;
  }
  return true;
}

// The warm-up, then the rest, the daemon's resources read after each.
bool Soak::work(Figures* f) {
  const auto started = Clock::now();
  const long warm_commands = static_cast<long>(static_cast<double>(o_.commands) * o_.warmup);
  const long warm_indications = static_cast<long>(static_cast<double>(o_.indications) * o_.warmup);
  struct Phase {
    long commands_from, commands_to, indications_from, indications_to;
    ProcessStatus* status;
    const char* name;
  };
  const Phase phases[] = {
      {0, warm_commands, 0, warm_indications, &f->warm, "warm-up"},
      {warm_commands, o_.commands, warm_indications, o_.indications, &f->end, "the rest"},
  };
  for (const Phase& p : phases) {
    std::thread commands([&] { send_commands(p.commands_to - p.commands_from); });
    std::thread samples([&] { inject(p.indications_from, p.indications_to); });
    commands.join();
    samples.join();
    if (!wait_quiet(o_.valgrind ? 1800s : 600s)) {
      report_failure(std::string("frames still missing after ") + p.name);
      return false;
    }
    *p.status = process_status(daemon_->pid());
  }
  f->seconds = std::chrono::duration<double>(Clock::now() - started).count();
  return true;
}

// The end: the next write fails and so does the close, and the daemon exits with its result.
int Soak::end_through_exit_path() {
  sim_->fault(kestrel_sim::FaultOp::kWrite, 5, 1, 60s);
  sim_->fault(kestrel_sim::FaultOp::kClose, kExitStatus, 1, 60s);
  tx_.send(kestrelctl::build_command(27, {0, 2}));
  int status = 0;
  if (!daemon_->wait_exit(o_.valgrind ? 600s : 60s, &status)) {
    daemon_->kill_and_reap();
    report_failure("the daemon did not end through its exit path");
  }
  return status;
}

void Soak::print_figures(const Figures& f) {
  long replies = 0;
  for (size_t t = 0; t < expected_.size(); ++t) {
    if (t == FRAME_HH_REFRESH || t == FRAME_SAMPLE) continue;
    replies += tally_.frames[t];
    if (tally_.frames[t] != expected_[t]) {
      printf("soak: frame type %zu: %ld received, %ld expected\n", t, tally_.frames[t].load(),
             expected_[t].load());
    }
  }
  printf("soak: %.1f s: %.0f sample indications/s, %.0f commands/s\n", f.seconds,
         static_cast<double>(o_.indications) / f.seconds,
         static_cast<double>(o_.commands) / f.seconds);
  printf("soak: frames: %ld injected samples, %ld stream samples, %ld replies, %ld refresh\n",
         tally_.injected.load(), tally_.stream.load(), replies,
         tally_.frames[FRAME_HH_REFRESH].load());
  printf("soak: daemon log: %ld lines", log_.lines());
  for (const auto& kv : log_.seen()) printf("; \"%s\" %ld", kv.first.c_str(), kv.second);
  printf("\n");
  const char* whose = o_.valgrind ? " (valgrind's own memory included)" : "";
  for (const auto& [when, u] : {std::pair("after warm-up:", f.warm), {"at the end:   ", f.end}}) {
    printf("soak: %s rss %ld kB (anon %ld, file %ld), %ld descriptors, %ld threads%s\n", when,
           u.rss_kib, u.rss_anon_kib, u.rss_file_kib, u.descriptors, u.threads, whose);
  }
  printf("soak: rss change %+.2f%%\n", f.rss_growth() * 100.0);
}

void Soak::check_figures(const Figures& f) {
  bool replies_match = send_failures_ == 0;
  for (size_t t = 0; t < expected_.size(); ++t) {
    if (t != FRAME_HH_REFRESH && t != FRAME_SAMPLE) {
      replies_match = replies_match && tally_.frames[t] == expected_[t];
    }
  }
  check(tally_.injected == o_.indications && injected_sent_ == o_.indications &&
            inject_failures_ == 0,
        "every injected sample came back as one frame, unchanged");
  check(tally_.odd_samples == 0 && tally_.other == 0 && tally_.overruns == 0,
        "no unexpected or lost frames");
  check(replies_match, "every command brought its reply frames");
  check(tally_.unanswered == 0, "every reply reports an answer of the healthy phone");
  // The last command's write failure is the one expected fault line.
  long faults = 0;
  for (const auto& kv : log_.seen()) faults += kv.first != kEarlyCallback ? kv.second : 0;
  check(faults == 1 && log_.seen("sensor1_write -error") == 1,
        "no failure in the daemon's log but the final one");
  const double growth = f.rss_growth();
  if (!o_.valgrind) {
    check(f.warm.rss_kib > 0 && f.end.rss_kib > 0 && growth <= o_.rss_tolerance &&
              growth >= -o_.rss_tolerance,
          "resident memory at the end within 1% of after warm-up");
  }
  check(f.warm.descriptors > 0 && f.end.descriptors == f.warm.descriptors, "no descriptor growth");
  check(f.warm.threads > 0 && f.end.threads == f.warm.threads, "no thread growth");
  if (o_.valgrind)
    check_valgrind(o_.valgrind_log,
                   [this](bool ok, const std::string& what) { return check(ok, what); });
  check(f.status == kExitStatus, "exit status " + std::to_string(f.status) +
                                     ": the close's result" +
                                     (o_.valgrind ? ", not valgrind's error code" : ""));
}

int Soak::run() {
  Figures f;
  if (!start()) {
    stop_receiving();
    return verdicts_.ok() ? 2 : 1;
  }
  work(&f);
  f.status = end_through_exit_path();
  stop_receiving();
  log_.update();
  print_figures(f);
  check_figures(f);
  const int status = verdicts_.finish();
  if (status != 0) report_failure("the soak missed");
  // A failed run leaves its files for a look; so does one whose valgrind log is among them.
  if (status != 0 || o_.valgrind_log.rfind(dir_.path(), 0) == 0) dir_.keep();
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  return kestrel_driver::tool_main<Soak>(argc, argv, parse_options);
}
