// Shared by the fault-matrix tests: kestreld runs as a child process (DaemonProcess), the kernel
// driver is a KernelPort on port 100, the sensor processor an in-process Simulator and the shell
// tools recording stand-ins. Beside what DaemonProcess parses, the log is read here with the
// thread id of every record, so a case can look at the lines of the main thread alone (its thread
// id is the process id) or of the sensor1 library's thread, each in the order it wrote them.
#pragma once

#include <dirent.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/types.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "byte_order.h"
#include "daemon_process.h"
#include "kernel_port.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace matrix {

using kestrelctl::build_command;
using kestrelctl::build_frame;
using kestrelctl::Frame;
using kestrelctl::KernelPort;

using namespace std::chrono_literals;
using Lines = std::vector<std::string>;
using Bytes = std::vector<uint8_t>;

inline Lines operator+(Lines a, const Lines& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

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
// by an empty line, which gives the message its newline back). The last line, still being
// written, is left out.
inline std::vector<Line> parse_log(const std::string& output) {
  const auto digits = [](const std::string& s) {
    return !s.empty() && s.find_first_not_of("0123456789") == std::string::npos;
  };
  std::vector<Line> out;
  for (size_t start = 0, end; (end = output.find('\n', start)) != std::string::npos;
       start = end + 1) {
    const std::string line = output.substr(start, end - start);
    std::istringstream in(line);
    std::string tag, prio, date, time, pid, tid;
    in >> tag >> prio >> date >> time >> pid >> tid;
    if (prio.size() == 1 && strchr("VDIWEF", prio[0]) != nullptr && date.size() == 5 &&
        date[2] == '-' && time.size() == 8 && digits(pid) && digits(tid)) {
      const auto at = in.tellg();
      const size_t pos = at < 0 ? line.size() : static_cast<size_t>(at);
      out.push_back({static_cast<int>(std::string("??VDIWEF").find(prio[0])), tag,
                     atol(tid.c_str()), pos < line.size() ? line.substr(pos + 1) : ""});
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

inline bool starts_with(const std::string& s, const std::string& prefix) {
  return s.compare(0, prefix.size(), prefix) == 0;
}

// Threads of a process (entries of /proc/<pid>/task), -1 once it is gone; waits until there are n.
inline bool wait_for_tasks(pid_t pid, int n, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    int count = -1;
    if (DIR* dir = opendir(("/proc/" + std::to_string(pid) + "/task").c_str())) {
      for (count = 0; struct dirent* e = readdir(dir);) count += e->d_name[0] != '.';
      closedir(dir);
    }
    if (count == n) return true;
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(2ms);
  }
}

// What the daemon did with one datagram: the main thread's texts from the walk's line of its
// first frame up to the receive loop's next pass, and the frames it sent meanwhile (sample
// frames and the coefficient refresh, which other threads send at any time, left out).
struct Outcome {
  Lines lines;
  std::vector<Frame> frames;
};

inline std::vector<Bytes> raw_frames(const Outcome& o) {
  std::vector<Bytes> out;
  for (const Frame& f : o.frames) out.push_back(f.raw);
  return out;
}

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
  explicit Rig(bool healthy = true) : sim(test_socket_path(), healthy) {
    EXPECT_TRUE(kernel.open_bound(100));
  }

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
    ASSERT_TRUE(kernel.next_frame_of_type(34, 10s)) << "the refresh frame of the start-up";
    sync();
  }

  // Returns once every line that the daemon's threads wrote before now has been read: the main
  // thread walks a marker datagram, and its line comes after theirs in the one stream.
  void sync() { run({}); }

  // Sends one datagram and then a marker datagram (a command number without an action, unique
  // per call), waits until the main thread has walked the marker, and returns the outcome.
  Outcome run(const Bytes& datagram) {
    const std::string marker = "process_message: " + std::to_string(next_marker_);
    // What the main thread logged so far belongs to datagrams sent before this one.
    main_seen_ = std::max(main_seen_, main_lines().size());
    if (!datagram.empty()) {
      EXPECT_TRUE(kernel.send(datagram));
    }
    EXPECT_TRUE(kernel.send(build_command(static_cast<uint16_t>(next_marker_++))));
    EXPECT_TRUE(daemon->wait_for(marker, 30s)) << daemon->output();
    Outcome out;
    const Lines main = main_lines();
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
    for (Frame& f : kernel.drain(0ms)) {
      if (is_reply_frame(f.type)) {
        out.frames.push_back(std::move(f));
      } else if (f.type != 2 && f.type != 34) {
        late.push_back(std::move(f));
      }
    }
    return out;
  }

  // The next frame of a type that the service callback sends, kept by run() or still to come.
  std::optional<Frame> callback_frame(uint16_t type, std::chrono::milliseconds timeout) {
    for (auto it = late.begin(); it != late.end(); ++it) {
      if (it->type != type) continue;
      Frame f = std::move(*it);
      late.erase(it);
      return f;
    }
    return kernel.next_frame_of_type(type, timeout);
  }

  // Waits until n records carry exactly this text (a trailing newline included).
  bool wait_for_text(const std::string& text, std::chrono::milliseconds timeout, size_t n = 1) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (count_text(text) < n) {
      if (std::chrono::steady_clock::now() >= deadline) return false;
      std::this_thread::sleep_for(2ms);
    }
    return true;
  }

  size_t count_text(const std::string& text) const {
    const std::vector<Line> all = log();
    return std::count_if(all.begin(), all.end(), [&](const Line& l) { return text_of(l) == text; });
  }

  // The lines of the thread that wrote first_text, from that line on. The handle's address in
  // the broken-pipe line differs from run to run and is replaced by "<handle>".
  Lines thread_lines_from(const std::string& first_text) const {
    const std::vector<Line> all = log();
    auto first = std::find_if(all.begin(), all.end(),
                              [&](const Line& l) { return text_of(l) == first_text; });
    Lines texts = thread_texts(all, first == all.end() ? 0 : first->tid);
    Lines out(std::find(texts.begin(), texts.end(), first_text), texts.end());
    for (std::string& l : out) {
      if (starts_with(l, "BROKEN_PIPE sensor1_handle 0x"))
        l = "BROKEN_PIPE sensor1_handle <handle>\n";
    }
    return out;
  }

  Lines main_lines() const { return thread_texts(log(), daemon->pid()); }
  std::vector<Line> log() const { return parse_log(daemon->output()); }

  kestrel_sim::Simulator sim;
  KernelPort kernel;
  FakeTools tools;
  std::unique_ptr<DaemonProcess> daemon;
  std::vector<Frame> late;  // callback frames that run() came across

 private:
  int next_marker_ = 1000;
  size_t main_seen_ = 0;
};

// The payload bytes of a frame as signed 32-bit words.
inline std::vector<int32_t> words_of(const Frame& f) {
  std::vector<int32_t> w;
  for (size_t i = 0; i + 4 <= f.payload.size(); i += 4) w.push_back(load_i32(f.payload.data(), i));
  return w;
}

// A reply payload of signed 32-bit words.
inline Bytes payload(const std::vector<int32_t>& words) {
  Bytes out(words.size() * 4);
  if (!words.empty()) memcpy(out.data(), words.data(), out.size());
  return out;
}

// The frame as the daemon sends it: header (nlmsg_pid 20000) and payload with its alignment.
inline Bytes frame_bytes(uint16_t type, Bytes body) {
  const uint32_t len = (static_cast<uint32_t>(body.size()) + 19) & ~3u, pid = 20000;
  Bytes f(16, 0);
  memcpy(f.data(), &len, 4);
  memcpy(f.data() + 4, &type, 2);
  memcpy(f.data() + 12, &pid, 4);
  body.resize(len - 16, 0);
  f.insert(f.end(), body.begin(), body.end());
  return f;
}

// The self-test reply of the accelerometer from its eight result words.
inline Bytes accel_reply(const std::vector<int32_t>& w) {
  return frame_bytes(
      9, payload({0, w[0], w[4], w[5], w[6], w[7], w[1], w[2], w[3], 0, 0, 0, 0, 0, 0, 0, 0, 0}));
}

}  // namespace matrix
