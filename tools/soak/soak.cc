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
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <linux/netlink.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <deque>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "byte_order.h"
#include "frame_codec.h"
#include "kernel_frame.h"
#include "tools/sim/simulator.h"
#include "tools/soak/daemon_driver.h"

#ifndef KESTRELD_BINARY
#error "KESTRELD_BINARY names the daemon to soak"
#endif

namespace {

using namespace kestrel_soak;

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

constexpr int kExitStatus = 77;  // the close result that ends the run
// Injected samples in flight (sent to the daemon, frame not yet back) at most.
constexpr long kInjectWindow = 2000;
// The injected sample: a gyroscope reading the daemon turns into {-61, 61, -30}.
constexpr uint8_t kInjectSensor = 10;
constexpr int32_t kInjectX = 1000, kInjectY = -1000, kInjectZ = 500;

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

void usage(FILE* out) {
  fprintf(out,
          "usage: kestrel-soak [options]   (run it in a network namespace of its own)\n"
          "  --indications N     sample indications to feed (default 1000000)\n"
          "  --commands N        kernel commands to send (default 100000)\n"
          "  --time-scale X      KESTREL_TIME_SCALE of the daemon (default 0.05)\n"
          "  --registry FILE     sensors registry for command 4 (default: none)\n"
          "  --daemon PATH       the daemon (default: the one built beside this program)\n"
          "  --valgrind          run the daemon under valgrind memcheck\n"
          "  --suppressions FILE valgrind suppressions\n"
          "  --valgrind-log FILE where valgrind writes (default: a temporary file)\n");
}

bool parse_options(int argc, char** argv, Options* o) {
  for (int i = 1; i < argc; ++i) {
    const std::string a = argv[i];
    auto value = [&](const char** out) {
      if (i + 1 >= argc) return false;
      *out = argv[++i];
      return true;
    };
    const char* v = nullptr;
    if (a == "--indications" && value(&v)) {
      o->indications = atol(v);
    } else if (a == "--commands" && value(&v)) {
      o->commands = atol(v);
    } else if (a == "--time-scale" && value(&v)) {
      o->time_scale = atof(v);
    } else if (a == "--registry" && value(&v)) {
      o->registry = v;
    } else if (a == "--daemon" && value(&v)) {
      o->daemon = v;
    } else if (a == "--valgrind") {
      o->valgrind = true;
    } else if (a == "--suppressions" && value(&v)) {
      o->suppressions = v;
    } else if (a == "--valgrind-log" && value(&v)) {
      o->valgrind_log = v;
    } else if (a == "--help") {
      usage(stdout);
      exit(0);
    } else {
      usage(stderr);
      return false;
    }
  }
  return o->indications >= 0 && o->commands >= 10 && o->time_scale > 0;
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

void count_frame(const kestrelctl::Frame& f, Tally* t) {
  if (f.malformed) {
    ++t->other;
    return;
  }
  if (f.type < t->frames.size()) {
    ++t->frames[f.type];
  } else {
    ++t->other;
  }
  const std::vector<uint8_t>& p = f.payload;
  auto word = [&](size_t i) { return p.size() >= 4 * (i + 1) ? load_i32(p.data(), 4 * i) : 0; };
  switch (f.type) {
    case FRAME_SAMPLE: {
      const int32_t code = word(0);
      const int16_t v0 = p.size() >= 6 ? static_cast<int16_t>(load_u16(p.data(), 4)) : 0;
      const int16_t v1 = p.size() >= 8 ? static_cast<int16_t>(load_u16(p.data(), 6)) : 0;
      const int16_t v2 = p.size() >= 10 ? static_cast<int16_t>(load_u16(p.data(), 8)) : 0;
      if (code == 1 && v0 == -61 && v1 == 61 && v2 == -30) {
        ++t->injected;
      } else if (code == 0 || code == 4 || code == 5) {
        ++t->stream;
      } else {
        ++t->odd_samples;
      }
      break;
    }
    case FRAME_STATUS:
      if (p.size() < 2 || p[1] != 0) ++t->unanswered;
      break;
    case FRAME_STORE_CALIBRATION:
      if (word(1) != 0) ++t->unanswered;
      break;
    case FRAME_MAG_FUSE_ROM:
    case FRAME_MAG_REGISTERS:
      if (word(8) != 0) ++t->unanswered;
      break;
    case FRAME_SELFTEST:
    case FRAME_GYRO_SELFTEST:
      if (word(1) != 1) ++t->unanswered;  // every healthy self test passes
      break;
    default:
      break;
  }
}

int open_kernel_socket(uint32_t port) {
  const int fd = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_USERSOCK);
  if (fd < 0) return -1;
  if (port != 0) {
    int size = 8 << 20;
    if (setsockopt(fd, SOL_SOCKET, SO_RCVBUFFORCE, &size, sizeof size) != 0) {
      setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &size, sizeof size);
    }
    struct sockaddr_nl addr = {};
    addr.nl_family = AF_NETLINK;
    addr.nl_pid = port;
    if (bind(fd, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) != 0) {
      close(fd);
      return -1;
    }
  }
  return fd;
}

void receive_frames(int fd, const std::atomic<bool>* stop, Tally* t) {
  std::vector<uint8_t> buf(65536);
  while (!stop->load()) {
    struct pollfd p = {fd, POLLIN, 0};
    if (poll(&p, 1, 100) <= 0) continue;
    for (;;) {
      const ssize_t n = recv(fd, buf.data(), buf.size(), MSG_DONTWAIT);
      if (n < 0) {
        if (errno == ENOBUFS) {
          ++t->overruns;
          continue;
        }
        break;
      }
      for (const kestrelctl::Frame& f :
           kestrelctl::split_frames(buf.data(), static_cast<size_t>(n))) {
        count_frame(f, t);
      }
    }
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

class Soak {
 public:
  explicit Soak(const Options& o) : o_(o) {}

  int run();

 private:
  bool prepare();
  void send_commands(long count);
  void inject(long from, long to);
  bool wait_quiet(std::chrono::seconds timeout);
  bool daemon_ended();
  void report_failure(const std::string& what);
  bool check(bool ok, const std::string& what);

  const Options& o_;
  std::string dir_;
  std::unique_ptr<kestrel_sim::Simulator> sim_;
  int kernel_fd_ = -1;
  int send_fd_ = -1;
  pid_t pid_ = -1;
  Tally tally_;
  LogTally log_;
  CommandStream commands_;
  std::array<std::atomic<long>, 64> expected_{};
  std::atomic<long> injected_sent_{0};
  std::atomic<long> inject_failures_{0};
  std::atomic<long> send_failures_{0};
  std::mutex exit_mu_;
  bool exited_ = false;
  int exit_status_ = 0;
  bool ok_ = true;
};

// True once the daemon has ended; its status is kept.
bool Soak::daemon_ended() {
  std::lock_guard<std::mutex> lock(exit_mu_);
  if (!exited_) exited_ = wait_exit(pid_, 0ms, &exit_status_);
  return exited_;
}

bool Soak::check(bool ok, const std::string& what) {
  printf("soak: %-62s %s\n", what.c_str(), ok ? "ok" : "MISS");
  if (!ok) ok_ = false;
  return ok;
}

void Soak::report_failure(const std::string& what) {
  fprintf(stderr, "soak: %s\n", what.c_str());
  std::lock_guard<std::mutex> lock(log_.mu);
  fprintf(stderr, "soak: the daemon's last log lines:\n");
  for (const std::string& l : log_.last) fprintf(stderr, "  %s\n", l.c_str());
  ok_ = false;
}

bool Soak::prepare() {
  dir_ = make_run_dir("kestrel-soak");
  return !dir_.empty();
}

void Soak::send_commands(long count) {
  struct sockaddr_nl addr = {};
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = kDaemonPort;
  for (long i = 0; i < count; ++i) {
    const Planned& p = commands_.next();
    if (p.reply >= 0) ++expected_[static_cast<size_t>(p.reply)];
    // Blocking: when the daemon's queue is full this waits for it.
    if (sendto(send_fd_, p.datagram.data(), p.datagram.size(), 0,
               reinterpret_cast<struct sockaddr*>(&addr), sizeof addr) < 0) {
      ++send_failures_;
    }
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

int Soak::run() {
  if (!prepare()) {
    fprintf(stderr, "soak: cannot create a temporary directory\n");
    return 2;
  }
  const std::string socket_path = dir_ + "/sensor1.sock";
  sim_ = std::make_unique<kestrel_sim::Simulator>(socket_path, true);
  kernel_fd_ = open_kernel_socket(kKernelPort);
  send_fd_ = open_kernel_socket(0);
  if (!sim_->listening() || kernel_fd_ < 0 || send_fd_ < 0) {
    fprintf(stderr, "soak: cannot open the sockets (run it in a network namespace of its own)\n");
    return 2;
  }
  std::atomic<bool> stop{false};
  std::thread receiver(receive_frames, kernel_fd_, &stop, &tally_);

  const std::map<std::string, std::string> env =
      daemon_environment(dir_, socket_path, o_.time_scale, o_.registry);
  char scale[32];
  snprintf(scale, sizeof scale, "%g", o_.time_scale);
  Options o = o_;
  if (o.valgrind && o.valgrind_log.empty()) o.valgrind_log = dir_ + "/valgrind.log";

  std::vector<std::string> args;
  if (o.valgrind) {
    args = {"valgrind", "--leak-check=full", "--error-exitcode=1", "--log-file=" + o.valgrind_log};
    if (!o.suppressions.empty()) args.push_back("--suppressions=" + o.suppressions);
  }
  args.push_back(o.daemon);
  int log_fd = -1;
  pid_ = start_daemon(args, env, &log_fd);
  if (pid_ < 0) {
    fprintf(stderr, "soak: cannot start %s\n", o.daemon.c_str());
    return 2;
  }
  std::thread log_reader(read_log, log_fd, &log_);

  printf("soak: %s%s, %ld sample indications, %ld commands of %d kinds, time scale %s\n",
         o.valgrind ? "valgrind memcheck on " : "", o.daemon.c_str(), o.indications, o.commands,
         kCommandKinds, scale);
  fflush(stdout);
  const auto started = Clock::now();
  // Ready: the start-up thread has opened the service and both start-up threads have ended.
  const auto ready_by = Clock::now() + (o.valgrind ? 120s : 30s);
  while (!(sim_->current_connection() != 0 && usage_of(pid_).threads == 2)) {
    if (daemon_ended() || Clock::now() >= ready_by) {
      report_failure("the daemon did not come up");
      kill(pid_, SIGKILL);
      stop = true;
      receiver.join();
      log_reader.join();
      return 1;
    }
    std::this_thread::sleep_for(20ms);
  }

  const long warm_commands = static_cast<long>(static_cast<double>(o.commands) * o.warmup);
  const long warm_indications = static_cast<long>(static_cast<double>(o.indications) * o.warmup);
  Usage warm, end;
  struct Phase {
    long commands_from, commands_to, indications_from, indications_to;
    Usage* usage;
    const char* name;
  };
  const Phase phases[] = {
      {0, warm_commands, 0, warm_indications, &warm, "warm-up"},
      {warm_commands, o.commands, warm_indications, o.indications, &end, "the rest"},
  };
  const std::chrono::seconds quiet_timeout = o.valgrind ? 1800s : 600s;
  for (const Phase& p : phases) {
    std::thread commands([&] { send_commands(p.commands_to - p.commands_from); });
    std::thread samples([&] { inject(p.indications_from, p.indications_to); });
    commands.join();
    samples.join();
    if (!wait_quiet(quiet_timeout)) {
      report_failure(std::string("frames still missing after ") + p.name);
      break;
    }
    *p.usage = usage_of(pid_);
  }
  const double seconds = std::chrono::duration<double>(Clock::now() - started).count();

  // The end: the next write fails and so does the close, and the daemon exits with its result.
  sim_->fault(kestrel_sim::FaultOp::kWrite, 5, 1, 60s);
  sim_->fault(kestrel_sim::FaultOp::kClose, kExitStatus, 1, 60s);
  const std::vector<uint8_t> last = kestrelctl::build_command(27, {0, 2});
  struct sockaddr_nl addr = {};
  addr.nl_family = AF_NETLINK;
  addr.nl_pid = kDaemonPort;
  sendto(send_fd_, last.data(), last.size(), 0, reinterpret_cast<struct sockaddr*>(&addr),
         sizeof addr);
  const auto end_by = Clock::now() + (o.valgrind ? 600s : 60s);
  while (!daemon_ended() && Clock::now() < end_by) std::this_thread::sleep_for(10ms);
  if (!daemon_ended()) {
    kill(pid_, SIGKILL);
    while (!daemon_ended()) std::this_thread::sleep_for(10ms);
    report_failure("the daemon did not end through its exit path");
  }
  const int status = exit_status_;
  log_reader.join();
  stop = true;
  receiver.join();

  // The figures.
  long replies = 0;
  bool replies_match = true;
  for (size_t t = 0; t < expected_.size(); ++t) {
    if (t == FRAME_HH_REFRESH || t == FRAME_SAMPLE) continue;
    replies += tally_.frames[t];
    if (tally_.frames[t] != expected_[t]) {
      printf("soak: frame type %zu: %ld received, %ld expected\n", t, tally_.frames[t].load(),
             expected_[t].load());
      replies_match = false;
    }
  }
  printf("soak: %.1f s: %.0f sample indications/s, %.0f commands/s\n", seconds,
         static_cast<double>(o.indications) / seconds, static_cast<double>(o.commands) / seconds);
  printf("soak: frames: %ld injected samples, %ld stream samples, %ld replies, %ld refresh\n",
         tally_.injected.load(), tally_.stream.load(), replies,
         tally_.frames[FRAME_HH_REFRESH].load());
  printf("soak: daemon log: %ld lines", log_.lines);
  for (const auto& kv : log_.seen) printf("; \"%s\" %ld", kv.first.c_str(), kv.second);
  printf("\n");
  const char* whose = o.valgrind ? " (valgrind's own memory included)" : "";
  printf("soak: after warm-up: rss %ld kB (anon %ld, file %ld), %d descriptors, %d threads%s\n",
         warm.rss_kb, warm.anon_kb, warm.file_kb, warm.descriptors, warm.threads, whose);
  printf("soak: at the end:    rss %ld kB (anon %ld, file %ld), %d descriptors, %d threads%s\n",
         end.rss_kb, end.anon_kb, end.file_kb, end.descriptors, end.threads, whose);
  const double growth = warm.rss_kb > 0 ? static_cast<double>(end.rss_kb - warm.rss_kb) /
                                              static_cast<double>(warm.rss_kb)
                                        : 1.0;
  printf("soak: rss change %+.2f%%\n", growth * 100.0);

  check(
      tally_.injected == o.indications && injected_sent_ == o.indications && inject_failures_ == 0,
      "every injected sample came back as one frame, unchanged");
  check(tally_.odd_samples == 0 && tally_.other == 0 && tally_.overruns == 0,
        "no unexpected or lost frames");
  check(replies_match && send_failures_ == 0, "every command brought its reply frames");
  check(tally_.unanswered == 0, "every reply reports an answer of the healthy phone");
  {
    std::lock_guard<std::mutex> lock(log_.mu);
    long faults = 0;
    for (const auto& kv : log_.seen) {
      if (kv.first != "cb has arrived without waiting") faults += kv.second;
    }
    // The last command's write failure is the one expected fault line.
    check(faults == 1 && log_.seen["sensor1_write -error"] == 1,
          "no failure in the daemon's log but the final one");
  }
  if (!o.valgrind) {
    check(warm.rss_kb > 0 && end.rss_kb > 0 && growth <= o.rss_tolerance &&
              growth >= -o.rss_tolerance,
          "resident memory at the end within 1% of after warm-up");
  }
  check(warm.descriptors > 0 && end.descriptors == warm.descriptors, "no descriptor growth");
  check(warm.threads > 0 && end.threads == warm.threads, "no thread growth");
  if (o.valgrind) {
    const ValgrindSummary v = read_valgrind_log(o.valgrind_log);
    printf(
        "soak: valgrind: %ld errors (%ld suppressed); definitely lost %ld, indirectly lost %ld, "
        "possibly lost %ld bytes; %ld bytes in suppressed leaks\n",
        v.errors, v.suppressed_errors, v.definitely, v.indirectly, v.possibly, v.suppressed_leaks);
    printf("soak: valgrind log: %s\n", o.valgrind_log.c_str());
    check(v.found && v.errors == 0, "valgrind: ERROR SUMMARY 0 errors");
    check(v.definitely == 0 && v.indirectly == 0 && v.possibly == 0,
          "valgrind: definitely, indirectly and possibly lost 0 bytes");
    check(status == kExitStatus, "exit status " + std::to_string(status) +
                                     ": the close's result, "
                                     "not valgrind's error code");
  } else {
    check(status == kExitStatus, "exit status " + std::to_string(status) + ": the close's result");
  }
  printf("soak: %s\n", ok_ ? "PASS" : "FAIL");
  if (!ok_) report_failure("the soak missed");
  if (ok_ && o.valgrind_log.rfind(dir_, 0) != 0) {
    remove_run_dir(dir_);
  }
  return ok_ ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  if (!parse_options(argc, argv, &o)) return 2;
  signal(SIGPIPE, SIG_IGN);
  setvbuf(stdout, nullptr, _IOLBF, 0);
  return Soak(o).run();
}
