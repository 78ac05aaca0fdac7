#include "bench/bench_support.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <linux/netlink.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <fstream>
#include <sstream>

#include "tools/soak/daemon_driver.h"

extern char** environ;

namespace kestrel_bench {

namespace {

constexpr char kNamespaceMarker[] = "KESTREL_BENCH_NETNS";

std::string read_file(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

}  // namespace

void enter_private_network_namespace(int argc, char** argv) {
  if (getenv(kNamespaceMarker) != nullptr) return;
  setenv(kNamespaceMarker, "1", 1);
  // As the tests do: a user namespace of one's own where the system allows it, else plain
  // `unshare -n`, which needs root.
  const bool user_ns = system("unshare -rn true >/dev/null 2>&1") == 0;
  std::vector<std::string> args = {"unshare", user_ns ? "-rn" : "-n", self_binary()};
  for (int i = 1; i < argc; ++i) args.push_back(argv[i]);
  std::vector<char*> cargs;
  for (std::string& a : args) cargs.push_back(a.data());
  cargs.push_back(nullptr);
  fflush(stdout);
  execvp("unshare", cargs.data());
  fprintf(stderr, "cannot run unshare: %s\n", strerror(errno));
  exit(1);
}

int64_t now_ns() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return int64_t{ts.tv_sec} * 1000000000 + ts.tv_nsec;
}

TempDir::TempDir()
    : path_(std::make_unique<std::string>(kestrel_soak::make_run_dir("kestrel-bench"))) {
  if (path_->empty()) {
    fprintf(stderr, "cannot create a run directory: %s\n", strerror(errno));
    exit(1);
  }
}

TempDir::~TempDir() {
  kestrel_soak::remove_run_dir(*path_);
}

ChildProcess::ChildProcess(const std::vector<std::string>& argv,
                           const std::map<std::string, std::string>& env,
                           const std::string& path_prepend, const std::string& stderr_path,
                           const std::string& stdout_path) {
  // Everything the child needs is prepared here: after fork only exec-safe calls are made.
  std::map<std::string, std::string> merged;
  for (char** e = environ; *e != nullptr; ++e) {
    const char* eq = strchr(*e, '=');
    if (eq != nullptr) merged[std::string(*e, static_cast<size_t>(eq - *e))] = eq + 1;
  }
  for (const auto& [name, value] : env) {
    if (value.empty()) {
      merged.erase(name);
    } else {
      merged[name] = value;
    }
  }
  if (!path_prepend.empty()) {
    merged["PATH"] = path_prepend + (merged.count("PATH") ? ":" + merged["PATH"] : "");
  }
  std::vector<std::string> env_strings;
  for (const auto& [name, value] : merged) env_strings.push_back(name + "=" + value);
  std::vector<char*> cenv;
  for (std::string& s : env_strings) cenv.push_back(s.data());
  cenv.push_back(nullptr);
  std::vector<std::string> args = argv;
  std::vector<char*> cargs;
  for (std::string& a : args) cargs.push_back(a.data());
  cargs.push_back(nullptr);

  const int err_fd = open(stderr_path.empty() ? "/dev/null" : stderr_path.c_str(),
                          O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  const int out_fd = open(stdout_path.empty() ? "/dev/null" : stdout_path.c_str(),
                          O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  const int in_fd = open("/dev/null", O_RDONLY | O_CLOEXEC);
  const pid_t parent = getpid();
  fflush(stdout);
  fflush(stderr);
  pid_ = fork();
  if (pid_ == 0) {
    // Dies with the benchmark program, whatever ends it.
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent) _exit(127);
    dup2(in_fd, 0);
    dup2(out_fd, 1);
    dup2(err_fd, 2);
    execve(cargs[0], cargs.data(), cenv.data());
    _exit(127);
  }
  close(err_fd);
  close(out_fd);
  close(in_fd);
  if (pid_ < 0) {
    fprintf(stderr, "fork: %s\n", strerror(errno));
    exit(1);
  }
}

ChildProcess::~ChildProcess() {
  if (pid_ > 0 && !reaped_) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
}

bool ChildProcess::running() {
  if (pid_ <= 0 || reaped_) return false;
  int status = 0;
  if (waitpid(pid_, &status, WNOHANG) == pid_) {
    reaped_ = true;
    return false;
  }
  return true;
}

std::map<std::string, std::string> daemon_env(const TempDir& dir, const std::string& socket,
                                              uint32_t kernel_port, double time_scale) {
  std::map<std::string, std::string> env =
      kestrel_soak::daemon_environment(dir.path(), socket, time_scale, "");
  env["KESTREL_KERNEL_PORT"] = std::to_string(kernel_port);
  // Nothing else of the caller's environment reaches the daemon's stand-ins ("" is unset).
  for (const char* name : {"KESTREL_SENSOR_REG", "KESTREL_SENSOR1_INIT_RESULT", "KESTREL_DIAG_INIT",
                           "KESTREL_DIAG_TX_MODE_RESULT"}) {
    env[name] = "";
  }
  return env;
}

std::string kestreld_binary() {
  return KESTRELD_BINARY;
}
std::string kestrel_sim_binary() {
  return KESTREL_SIM_BINARY;
}

std::string self_binary() {
  char path[4096];
  const ssize_t n = readlink("/proc/self/exe", path, sizeof path - 1);
  if (n <= 0) return "/proc/self/exe";
  path[n] = '\0';
  return path;
}

bool NetlinkPort::receive_type(uint16_t type, std::chrono::milliseconds timeout,
                               std::vector<uint8_t>* frame) {
  const std::optional<kestrelctl::Frame> f = next_frame_of_type(type, timeout);
  if (f) *frame = f->raw;
  return f.has_value();
}

namespace {

// Up to 64 datagrams a system call, so the kernel side costs the sender as little as it can.
constexpr size_t kDrainBatch = 64;
constexpr size_t kDrainDatagram = 2048;

// Datagrams of one recvmmsg call, walked for frames of one type.
class DatagramBatch {
 public:
  DatagramBatch() : buffers_(kDrainBatch * kDrainDatagram) {}
  // Receives what is queued (at most kDrainBatch datagrams) without waiting. Sets *datagrams to
  // the number received and returns the number of frames of type among them.
  uint64_t receive(int fd, uint16_t type, int* datagrams) {
    for (size_t i = 0; i < kDrainBatch; ++i) {
      iov_[i] = {buffers_.data() + i * kDrainDatagram, kDrainDatagram};
      memset(&msgs_[i], 0, sizeof msgs_[i]);
      msgs_[i].msg_hdr.msg_iov = &iov_[i];
      msgs_[i].msg_hdr.msg_iovlen = 1;
    }
    const int got = recvmmsg(fd, msgs_, kDrainBatch, MSG_DONTWAIT, nullptr);
    *datagrams = got;
    uint64_t counted = 0;
    for (int i = 0; i < got; ++i) {
      const uint8_t* d = buffers_.data() + static_cast<size_t>(i) * kDrainDatagram;
      const size_t n = msgs_[i].msg_len;
      size_t pos = 0;
      while (n - pos >= sizeof(nlmsghdr)) {
        nlmsghdr hdr;
        memcpy(&hdr, d + pos, sizeof hdr);
        if (hdr.nlmsg_len < sizeof hdr || hdr.nlmsg_len > n - pos) break;
        if (hdr.nlmsg_type == type) ++counted;
        pos += NLMSG_ALIGN(hdr.nlmsg_len);
      }
    }
    return counted;
  }

 private:
  std::vector<uint8_t> buffers_;
  mmsghdr msgs_[kDrainBatch];
  iovec iov_[kDrainBatch];
};

}  // namespace

uint64_t NetlinkPort::drain(uint16_t type) {
  DatagramBatch batch;
  uint64_t counted = 0;
  int datagrams = 0;
  do {
    counted += batch.receive(fd(), type, &datagrams);
  } while (datagrams == static_cast<int>(kDrainBatch));
  return counted;
}

FrameDrain::FrameDrain(uint32_t port_id, uint16_t counted_type)
    : port_(port_id), type_(counted_type) {
  if (port_.ok()) thread_ = std::thread([this] { run(); });
}

FrameDrain::~FrameDrain() {
  stop_.store(true);
  if (thread_.joinable()) thread_.join();
}

bool FrameDrain::wait_for_count(uint64_t n, std::chrono::milliseconds timeout) const {
  return wait_until([&] { return count() >= n; }, timeout);
}

void FrameDrain::run() {
  DatagramBatch batch;
  while (!stop_.load()) {
    pollfd p = {port_.fd(), POLLIN, 0};
    if (poll(&p, 1, 50) <= 0) continue;
    int datagrams = 0;
    do {
      const uint64_t counted = batch.receive(port_.fd(), type_, &datagrams);
      if (counted > 0) {
        last_ns_.store(now_ns(), std::memory_order_release);
        count_.fetch_add(counted, std::memory_order_acq_rel);
      }
    } while (datagrams == static_cast<int>(kDrainBatch));
  }
}

ProcessStatus process_status(pid_t pid) {
  ProcessStatus s;
  std::istringstream text(read_file("/proc/" + std::to_string(pid) + "/status"));
  std::string line;
  while (std::getline(text, line)) {
    const size_t colon = line.find(':');
    if (colon == std::string::npos) continue;
    const std::string key = line.substr(0, colon);
    const long value = strtol(line.c_str() + colon + 1, nullptr, 10);
    if (key == "VmRSS") s.rss_kib = value;
    if (key == "RssAnon") s.rss_anon_kib = value;
    if (key == "RssFile") s.rss_file_kib = value;
    if (key == "VmHWM") s.hwm_kib = value;
    if (key == "Threads") s.threads = value;
  }
  return s;
}

long process_cpu_ticks(pid_t pid) {
  const std::string stat = read_file("/proc/" + std::to_string(pid) + "/stat");
  const size_t paren = stat.rfind(')');
  if (paren == std::string::npos) return -1;
  // After the command name: field 3 (state) onward; utime and stime are fields 14 and 15.
  std::istringstream fields(stat.substr(paren + 1));
  std::string field;
  long utime = -1;
  long stime = -1;
  for (int n = 3; fields >> field && n <= 15; ++n) {
    if (n == 14) utime = strtol(field.c_str(), nullptr, 10);
    if (n == 15) stime = strtol(field.c_str(), nullptr, 10);
  }
  return utime < 0 || stime < 0 ? -1 : utime + stime;
}

namespace {

// The sum of read(the thread's /proc directory) over the process's threads; -1 when unreadable.
int64_t sum_over_threads(pid_t pid, const std::function<int64_t(const std::string&)>& read) {
  const std::string dir = "/proc/" + std::to_string(pid) + "/task";
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return -1;
  int64_t total = 0;
  while (dirent* e = readdir(d)) {
    if (e->d_name[0] != '.') total += read(dir + "/" + e->d_name);
  }
  closedir(d);
  return total;
}

// Sums the named fields of each thread's status.
long sum_task_status(pid_t pid, const std::vector<std::string>& fields) {
  return static_cast<long>(sum_over_threads(pid, [&](const std::string& task) {
    std::istringstream text(read_file(task + "/status"));
    int64_t total = 0;
    for (std::string line; std::getline(text, line);) {
      for (const std::string& field : fields) {
        if (line.rfind(field + ":", 0) == 0)
          total += strtol(line.c_str() + field.size() + 1, nullptr, 10);
      }
    }
    return total;
  }));
}

}  // namespace

long process_context_switches(pid_t pid) {
  return sum_task_status(pid, {"voluntary_ctxt_switches", "nonvoluntary_ctxt_switches"});
}

long process_voluntary_switches(pid_t pid) {
  return sum_task_status(pid, {"voluntary_ctxt_switches"});
}

int64_t process_cpu_ns(pid_t pid) {
  return sum_over_threads(pid, [](const std::string& task) {
    return strtoll(read_file(task + "/schedstat").c_str(), nullptr, 10);
  });
}

long process_thread_count(pid_t pid) {
  return static_cast<long>(sum_over_threads(pid, [](const std::string&) { return 1; }));
}

bool wait_until(const std::function<bool()>& cond, std::chrono::milliseconds timeout) {
  const int64_t deadline = now_ns() + static_cast<int64_t>(timeout.count()) * 1000000;
  for (;;) {
    if (cond()) return true;
    if (now_ns() > deadline) return false;
    usleep(2000);
  }
}

double median(std::vector<double> values) {
  if (values.empty()) return std::nan("");
  std::sort(values.begin(), values.end());
  const size_t n = values.size();
  return n % 2 == 1 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

std::string format_number(double value, int decimals) {
  if (std::isnan(value)) return "n/a";
  char text[64];
  snprintf(text, sizeof text, "%.*f", decimals, value);
  return text;
}

std::string format_ns(double ns) {
  if (std::isnan(ns)) return "n/a";
  if (ns == 0) return "0 ns";
  if (ns >= 1e6) return format_number(ns / 1e6, 2) + " ms";
  if (ns >= 1e4) return format_number(ns / 1e3, 1) + " us";
  if (ns >= 1e3) return format_number(ns / 1e3, 2) + " us";
  if (ns >= 100) return format_number(ns, 0) + " ns";
  return format_number(ns, 1) + " ns";
}

std::string format_ratio(double ratio) {
  if (std::isnan(ratio)) return "n/a";
  return format_number(ratio, ratio >= 10 ? 1 : 2) + "x";
}

std::string verdict(bool ok, bool measured) {
  if (!measured) return "-";
  return ok ? "meets" : "misses";
}

namespace {

// Prints the library's table as usual and keeps every iteration run for the summary.
class RecordingReporter : public benchmark::ConsoleReporter {
 public:
  explicit RecordingReporter(RunRecords* records)
      : benchmark::ConsoleReporter(OO_Tabular), records_(records) {}

  void ReportRuns(const std::vector<Run>& reports) override {
    benchmark::ConsoleReporter::ReportRuns(reports);
    for (const Run& run : reports) {
      if (run.run_type != Run::RT_Iteration) continue;
      std::string name = run.run_name.function_name;
      if (!run.run_name.args.empty()) name += "/" + run.run_name.args;
      RunRecord& record = (*records_)[name];
      if (run.error_occurred) {
        record.error = run.error_message.empty() ? "failed" : run.error_message;
        continue;
      }
      const double to_ns = 1e9 / benchmark::GetTimeUnitMultiplier(run.time_unit);
      record.real_ns.push_back(run.GetAdjustedRealTime() * to_ns);
      record.cpu_ns.push_back(run.GetAdjustedCPUTime() * to_ns);
      for (const auto& [key, counter] : run.counters) record.counters[key].push_back(counter.value);
    }
  }

 private:
  RunRecords* records_;
};

std::string load_average() {
  std::string text = read_file("/proc/loadavg");
  // The three averages only.
  std::istringstream in(text);
  std::string a, b, c;
  in >> a >> b >> c;
  return a + " " + b + " " + c;
}

void print_summary(const std::string& title, const Summary& summary, const std::string& load_before,
                   const std::string& load_after) {
  printf("\n== %s\n", title.c_str());
  for (const SummaryRow& r : summary.rows()) {
    printf("%-44s daemon %-12s limit %-34s ratio %-7s target %-10s %s\n", r.figure.c_str(),
           r.daemon.c_str(), r.limit.c_str(), r.ratio.c_str(), r.target.c_str(), r.verdict.c_str());
  }
  for (const std::string& n : summary.notes()) printf("   %s\n", n.c_str());
  printf("load average before %s, after %s\n", load_before.c_str(), load_after.c_str());
  fflush(stdout);
}

void write_markdown(const std::string& path, const Summary& summary, const std::string& load_before,
                    const std::string& load_after) {
  std::ofstream out(path);
  out << "| Figure | kestreld | Limit | Ratio | Target | |\n";
  out << "|---|---|---|---|---|---|\n";
  for (const SummaryRow& r : summary.rows()) {
    out << "| " << r.figure << " | " << r.daemon << " | " << r.limit << " | " << r.ratio << " | "
        << r.target << " | " << r.verdict << " |\n";
  }
  out << "\n";
  for (const std::string& n : summary.notes()) out << "- " << n << "\n";
  if (!summary.notes().empty()) out << "\n";
  out << "Load average (1, 5, 15 min) when this program started: " << load_before
      << "; when it ended: " << load_after << ".\n";
}

}  // namespace

int run_benchmarks(int argc, char** argv, const std::string& title,
                   const std::function<void(const RunRecords&, Summary*)>& summarize,
                   const std::function<void()>& teardown) {
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) return 1;
  const std::string load_before = load_average();
  RunRecords records;
  RecordingReporter reporter(&records);
  benchmark::RunSpecifiedBenchmarks(&reporter);
  if (teardown) teardown();
  const std::string load_after = load_average();
  Summary summary;
  summarize(records, &summary);
  print_summary(title, summary, load_before, load_after);
  if (const char* path = getenv("KESTREL_BENCH_SUMMARY")) {
    write_markdown(path, summary, load_before, load_after);
  }
  benchmark::Shutdown();
  bool failed = false;
  for (const auto& [name, record] : records) {
    if (!record.error.empty()) {
      fprintf(stderr, "%s failed: %s\n", name.c_str(), record.error.c_str());
      failed = true;
    }
  }
  return failed ? 1 : 0;
}

}  // namespace kestrel_bench
