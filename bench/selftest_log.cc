// SPDX-License-Identifier: Apache-2.0
// The log records of a self test, from a daemon of its own whose log goes to a file.
#include "bench/selftest_log.h"

#include <unistd.h>

#include <fstream>

#include "kernel_frame.h"

namespace kestrel_bench {

namespace {

constexpr int kCounted = 20;

// The daemon's log after its next lines have reached the file: the receive loop's line after a
// command comes once the reply is out.
void settle(kestrel_driver::DaemonLog* log, std::vector<kestrel_driver::LogRecord>* records) {
  usleep(100 * 1000);
  log->update(records);
}

std::string escaped(const std::string& text) {
  std::string out;
  for (char c : text) out += c == '\n' ? "\\n" : c == '\\' ? "\\\\" : std::string(1, c);
  return out;
}

std::string unescaped(const std::string& text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\' && i + 1 < text.size()) {
      out += text[++i] == 'n' ? '\n' : text[i];
    } else {
      out += text[i];
    }
  }
  return out;
}

}  // namespace

SelftestLog record_selftest_log(const kestrel_driver::RunDir& dir, kestrel_sim::Simulator* phone,
                                NetlinkPort* kernel, double time_scale) {
  SelftestLog out;
  const int opened = phone->opened_connections();
  kestrel_driver::DaemonLog log(dir.file("selftest-log.txt"));
  kestrel_driver::ChildProcess daemon(
      {kestreld_binary()},
      kestrel_driver::daemon_environment(dir, phone->socket_path(), time_scale), log.path());
  std::vector<uint8_t> frame;
  if (!kestrel_driver::wait_up(
          &daemon, [&] { return phone->opened_connections() > opened; }, 2,
          std::chrono::seconds(30)) ||
      !kernel->receive_type(FRAME_HH_REFRESH, std::chrono::seconds(5), &frame)) {
    out.error = "kestreld did not come up for the log count";
    return out;
  }
  out.main_thread = daemon.pid();
  const std::vector<uint8_t> command = kestrelctl::build_command(NETLINK_MESSAGE_SELFTEST, {0});
  auto self_test = [&] {
    return kernel->send(command) &&
           kernel->receive_type(FRAME_SELFTEST, std::chrono::seconds(5), &frame);
  };
  // The first (uncounted) self test, the counted ones, and the one whose records are kept.
  bool ok = self_test();
  settle(&log, nullptr);
  const long before = log.records();
  for (int i = 0; i < kCounted && ok; ++i) ok = self_test();
  settle(&log, nullptr);
  out.records_per_command = static_cast<double>(log.records() - before) / kCounted;
  ok = ok && self_test();
  settle(&log, &out.records);
  if (!ok || out.records.empty()) out.error = "a self test of the log count got no reply";
  return out;
}

bool write_records(const std::string& path, const SelftestLog& log) {
  std::ofstream out(path, std::ios::trunc);
  for (const kestrel_driver::LogRecord& r : log.records) {
    if (r.tag != "KESTRELD") continue;  // the daemon's own records, not the stand-ins'
    out << r.priority << (r.tid == log.main_thread ? " m " : " l ") << escaped(r.message) << "\n";
  }
  return static_cast<bool>(out);
}

std::vector<ReplayedRecord> read_records(const std::string& path) {
  std::vector<ReplayedRecord> out;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    if (line.size() < 4) continue;
    out.push_back({line[0] - '0', line[2] == 'm', unescaped(line.substr(4))});
  }
  return out;
}

}  // namespace kestrel_bench
