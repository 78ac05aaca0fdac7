// SPDX-License-Identifier: Apache-2.0
// The log records kestreld writes for an accelerometer self test, taken from a daemon of its own
// whose log goes to a file: how many a self test writes, and the records of one, which the relays
// of the round trip replay in place of the daemon's own lines.
#pragma once

#include <string>
#include <vector>

#include "bench/bench_support.h"
#include "tools/sim/simulator.h"

namespace kestrel_bench {

struct SelftestLog {
  double records_per_command = 0;
  std::vector<kestrel_driver::LogRecord> records;  // of the last self test
  long main_thread = 0;                            // the daemon's pid: its main thread's id
  std::string error;
};

// Runs kestreld in dir against phone for 20 self tests and one more, and ends it.
SelftestLog record_selftest_log(const kestrel_driver::RunDir& dir, kestrel_sim::Simulator* phone,
                                NetlinkPort* kernel, double time_scale);

// The daemon's own records (not the stand-ins') as a file of lines "<priority> <m|l> <message>", m
// for the main thread and l for the library's, the message's newlines and backslashes escaped; and
// read back.
bool write_records(const std::string& path, const SelftestLog& log);
struct ReplayedRecord {
  int priority;
  bool main_thread;
  std::string message;
};
std::vector<ReplayedRecord> read_records(const std::string& path);

}  // namespace kestrel_bench
