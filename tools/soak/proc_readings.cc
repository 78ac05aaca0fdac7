// SPDX-License-Identifier: Apache-2.0
// What /proc tells of a running process.
#include "tools/soak/proc_readings.h"

#include <dirent.h>
#include <stdlib.h>

#include <fstream>
#include <functional>
#include <sstream>
#include <string>
#include <vector>

namespace kestrel_driver {

namespace {

std::string read_file(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

// The sum of read(entry) over the entries of a directory; -1 when it cannot be read.
int64_t sum_over_entries(const std::string& dir,
                         const std::function<int64_t(const std::string&)>& read) {
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return -1;
  int64_t total = 0;
  while (dirent* e = readdir(d)) {
    if (e->d_name[0] != '.') total += read(dir + "/" + e->d_name);
  }
  closedir(d);
  return total;
}

long count_entries(const std::string& dir) {
  return static_cast<long>(sum_over_entries(dir, [](const std::string&) { return 1; }));
}

}  // namespace

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
  s.descriptors = count_entries("/proc/" + std::to_string(pid) + "/fd");
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
  return sum_over_entries("/proc/" + std::to_string(pid) + "/task", read);
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
  return count_entries("/proc/" + std::to_string(pid) + "/task");
}

std::string load_average() {
  std::istringstream in(read_file("/proc/loadavg"));
  std::string a, b, c;
  in >> a >> b >> c;
  return a + " " + b + " " + c;
}

}  // namespace kestrel_driver
