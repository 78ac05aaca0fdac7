// SPDX-License-Identifier: Apache-2.0
#include "bench/bench_support.h"

#include <errno.h>
#include <linux/netlink.h>
#include <poll.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <fstream>

namespace kestrel_bench {

namespace {

constexpr char kNamespaceMarker[] = "KESTREL_BENCH_NETNS";

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

double median(std::vector<double> values) {
  if (values.empty()) return std::nan("");
  std::sort(values.begin(), values.end());
  const size_t n = values.size();
  return n % 2 == 1 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

double median_real_ns(const RunRecords& runs, const std::string& benchmark) {
  const auto it = runs.find(benchmark);
  return it == runs.end() ? std::nan("") : median(it->second.real_ns);
}

double mean_real_ns(const RunRecords& runs, const std::string& benchmark) {
  const auto it = runs.find(benchmark);
  return it == runs.end() ? std::nan("") : mean(it->second.real_ns);
}

double counter(const RunRecords& runs, const std::string& benchmark, const std::string& key) {
  const auto it = runs.find(benchmark);
  if (it == runs.end()) return std::nan("");
  const auto c = it->second.counters.find(key);
  return c == it->second.counters.end() ? std::nan("") : median(c->second);
}

double mean(const std::vector<double>& values) {
  if (values.empty()) return std::nan("");
  double sum = 0;
  for (double v : values) sum += v;
  return sum / static_cast<double>(values.size());
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
  const std::string load_before = kestrel_driver::load_average();
  RunRecords records;
  RecordingReporter reporter(&records);
  benchmark::RunSpecifiedBenchmarks(&reporter);
  if (teardown) teardown();
  const std::string load_after = kestrel_driver::load_average();
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
