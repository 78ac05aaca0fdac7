// SPDX-License-Identifier: Apache-2.0
// What /proc tells of a running process: its memory, threads and descriptors, and the CPU time
// and context switches of its threads.
#pragma once

#include <stdint.h>
#include <sys/types.h>

#include <string>

namespace kestrel_driver {

struct ProcessStatus {
  long rss_kib = -1;       // VmRSS
  long rss_anon_kib = -1;  // RssAnon: heap, stacks and other private memory
  long rss_file_kib = -1;  // RssFile: mapped files (code of the program and its libraries)
  long hwm_kib = -1;       // VmHWM
  long threads = -1;       // Threads
  long descriptors = -1;   // entries of /proc/<pid>/fd
};
ProcessStatus process_status(pid_t pid);
// utime + stime in clock ticks, -1 when unreadable.
long process_cpu_ticks(pid_t pid);
// Voluntary and involuntary context switches summed over the process's threads.
long process_context_switches(pid_t pid);
// Voluntary context switches alone (a thread blocked: it waited for a socket, a lock or a
// condition), summed over the process's threads.
long process_voluntary_switches(pid_t pid);
// CPU time of the process's live threads in nanoseconds (first field of each thread's
// schedstat), -1 when unreadable.
int64_t process_cpu_ns(pid_t pid);
// Number of threads (entries of /proc/<pid>/task).
long process_thread_count(pid_t pid);

// The system's load averages over 1, 5 and 15 minutes, "0.52 0.58 0.59".
std::string load_average();

}  // namespace kestrel_driver
