// Shared by the fault-matrix tests: kestreld runs as a child process (DaemonProcess), the kernel
// driver is a KernelPeer on port 100, the sensor processor an in-process Simulator and the shell
// tools recording stand-ins. Beside what DaemonProcess parses, the log is read here with the
// thread id of every record, so a case can look at the lines of the main thread alone (its thread
// id is the process id) or of the sensor1 library's thread, each in the order it wrote them.
#pragma once

#include <dirent.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/types.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "daemon_process.h"
#include "kernel_peer.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace matrix {

using namespace std::chrono_literals;
using Lines = std::vector<std::string>;

// One log record and the thread that wrote it.
struct Line {
  int priority = 0;
  std::string tag;
  long tid = 0;
  std::string message;
};

// "message" for the daemon's own records, "<tag>: message" for the stand-ins' (libsensor1,
// libsensor_reg, libdiag).
inline std::string text_of(const Line& l) {
  return l.tag == "KESTRELD" ? l.message : l.tag + ": " + l.message;
}

// Every record of the daemon's stderr, as liblog writes them:
//   <tag> <P> <MM-DD> <HH:MM:SS> <pid> <tid> <message>
// A line that is no record continues the message before it (a message ending in "\n" is followed
// by an empty line, which gives the message its newline back).
inline std::vector<Line> parse_log(const std::string& output) {
  std::vector<Line> out;
  size_t start = 0;
  while (start < output.size()) {
    size_t end = output.find('\n', start);
    if (end == std::string::npos) break;  // the last line is still being written
    const std::string line = output.substr(start, end - start);
    start = end + 1;
    size_t pos = 0;
    std::string fields[6];
    bool record = true;
    for (std::string& f : fields) {
      while (pos < line.size() && line[pos] == ' ') ++pos;
      const size_t from = pos;
      while (pos < line.size() && line[pos] != ' ') ++pos;
      if (pos == from) {
        record = false;
        break;
      }
      f = line.substr(from, pos - from);
    }
    const std::string prio = record ? fields[1] : "";
    record = record && prio.size() == 1 &&
             std::string("VDIWEF").find(prio[0]) != std::string::npos && fields[2].size() == 5 &&
             fields[2][2] == '-' && fields[3].size() == 8 &&
             fields[4].find_first_not_of("0123456789") == std::string::npos &&
             fields[5].find_first_not_of("0123456789") == std::string::npos;
    if (record) {
      Line l;
      l.tag = fields[0];
      l.priority = static_cast<int>(std::string("??VDIWEF").find(prio[0]));
      l.tid = atol(fields[5].c_str());
      l.message = pos < line.size() ? line.substr(pos + 1) : "";
      out.push_back(std::move(l));
    } else if (!out.empty()) {
      out.back().message += "\n" + line;
    }
  }
  return out;
}

// The texts one thread wrote, in order.
inline Lines thread_texts(const std::vector<Line>& lines, long tid) {
  Lines out;
  for (const Line& l : lines) {
    if (l.tid == tid) out.push_back(text_of(l));
  }
  return out;
}

// The thread that wrote the first record with this exact text, or 0.
inline long thread_of(const std::vector<Line>& lines, const std::string& text) {
  for (const Line& l : lines) {
    if (text_of(l) == text) return l.tid;
  }
  return 0;
}

inline bool starts_with(const std::string& s, const std::string& prefix) {
  return s.compare(0, prefix.size(), prefix) == 0;
}

inline size_t count_prefix(const Lines& lines, const std::string& prefix) {
  return static_cast<size_t>(std::count_if(
      lines.begin(), lines.end(), [&](const std::string& l) { return starts_with(l, prefix); }));
}

// Threads of a process (entries of /proc/<pid>/task), -1 once it is gone.
inline int task_count(pid_t pid) {
  DIR* dir = opendir(("/proc/" + std::to_string(pid) + "/task").c_str());
  if (dir == nullptr) return -1;
  int n = 0;
  while (struct dirent* e = readdir(dir)) {
    if (e->d_name[0] != '.') ++n;
  }
  closedir(dir);
  return n;
}

inline bool wait_for_tasks(pid_t pid, int n, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (task_count(pid) != n) {
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(2ms);
  }
  return true;
}

// What the daemon did with one datagram: the main thread's texts from the walk's line of its
// first frame up to the receive loop's next pass, and the frames it sent meanwhile (sample
// frames and the coefficient refresh, which other threads send at any time, left out).
struct Outcome {
  Lines lines;
  std::vector<KernelFrame> frames;
};

// Frames the main thread sends as replies; the others come from the callback and the start-up
// threads whenever their turn comes.
inline bool is_reply_frame(uint16_t type) {
  return type != 2 && type != 20 && type != 30 && type != 33 && type != 34;
}

// A running daemon with the kernel, the sensor processor and the shell tools around it.
class Rig {
 public:
  // The simulator listens (answering as a healthy phone or only as told) and the kernel's port
  // is bound; the daemon starts with start(), so a case can prepare the simulator first.
  explicit Rig(bool healthy = true) : sim(test_socket_path(), healthy), kernel(100) {}

  void start(const DaemonEnv& env = {}) {
    daemon = std::make_unique<DaemonProcess>(env, tools.dir());
  }

  // Waits until the receive loop runs, the start-up thread has opened the service (connection
  // 1) and both start-up threads have ended: the daemon is left with its main thread and the
  // sensor1 library's thread, DIAG logging enabled and the first refresh frame sent.
  void wait_until_settled() {
    ASSERT_TRUE(daemon->wait_for("main: do while start = 0\n", 10s)) << daemon->output();
    ASSERT_TRUE(sim.wait_for_connection(10s)) << daemon->output();
    ASSERT_TRUE(wait_for_tasks(daemon->pid(), 2, 10s)) << daemon->output();
    ASSERT_TRUE(kernel.receive_type(34, 10s)) << "the refresh frame of the start-up";
    sync();
  }

  // Returns once every line that the daemon's threads wrote before now has been read: the main
  // thread walks a marker datagram, and its line comes after theirs in the one stream.
  void sync() { run({}); }

  // Sends one datagram and then a marker datagram (a command number without an action, unique
  // per call), waits until the main thread has walked the marker, and returns the outcome.
  Outcome run(const std::vector<uint8_t>& datagram) {
    const std::string marker = "process_message: " + std::to_string(next_marker_);
    // What the main thread logged so far belongs to datagrams sent before this one.
    main_seen_ = std::max(main_seen_, thread_texts(log(), daemon->pid()).size());
    if (!datagram.empty()) {
      EXPECT_TRUE(kernel.send(datagram));
    }
    EXPECT_TRUE(kernel.send(command_frame(static_cast<uint16_t>(next_marker_++))));
    EXPECT_TRUE(daemon->wait_for(marker, 30s)) << daemon->output();
    Outcome out;
    const Lines main = thread_texts(parse_log(daemon->output()), daemon->pid());
    size_t m = main_seen_;
    while (m < main.size() && main[m] != marker) ++m;
    if (!datagram.empty()) {
      size_t i = main_seen_;
      while (i < m && !starts_with(main[i], "left = ")) ++i;
      for (++i; i < m && !starts_with(main[i], "main: do while start = "); ++i) {
        out.lines.push_back(main[i]);
      }
    }
    main_seen_ = m + 1;
    // The main thread sent its frames before it walked the marker: they are queued already.
    for (KernelFrame& f : kernel.drain(0ms)) {
      if (is_reply_frame(f.type)) {
        out.frames.push_back(std::move(f));
      } else if (f.type != 2 && f.type != 34) {
        late.push_back(std::move(f));
      }
    }
    return out;
  }

  // The next frame of a type that the service callback sends, kept by run() or still to come.
  std::optional<KernelFrame> callback_frame(uint16_t type, std::chrono::milliseconds timeout) {
    for (auto it = late.begin(); it != late.end(); ++it) {
      if (it->type == type) {
        KernelFrame f = std::move(*it);
        late.erase(it);
        return f;
      }
    }
    return kernel.receive_type(type, timeout);
  }

  // Waits until n records carry exactly this text (a trailing newline included).
  bool wait_for_text(const std::string& text, std::chrono::milliseconds timeout, size_t n = 1) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    for (;;) {
      size_t seen = 0;
      for (const Line& l : log()) seen += text_of(l) == text ? 1 : 0;
      if (seen >= n) return true;
      if (std::chrono::steady_clock::now() >= deadline) return false;
      std::this_thread::sleep_for(2ms);
    }
  }

  Lines lines_of_thread(long tid) const { return thread_texts(parse_log(daemon->output()), tid); }
  std::vector<Line> log() const { return parse_log(daemon->output()); }

  kestrel_sim::Simulator sim;
  KernelPeer kernel;
  FakeTools tools;
  std::unique_ptr<DaemonProcess> daemon;
  std::vector<KernelFrame> late;  // callback frames that run() came across

 private:
  int next_marker_ = 1000;
  size_t main_seen_ = 0;
};

// The payload bytes of a frame as signed 32-bit words.
inline std::vector<int32_t> words_of(const KernelFrame& f) {
  std::vector<int32_t> w;
  for (size_t i = 0; i + 4 <= f.payload.size(); i += 4) w.push_back(f.word(i / 4));
  return w;
}

}  // namespace matrix
