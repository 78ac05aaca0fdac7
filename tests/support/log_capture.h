// SPDX-License-Identifier: Apache-2.0
// Captures every record logged in this process through liblog, by installing a logger.
#pragma once

#include <chrono>
#include <string>
#include <vector>

// Log lines in order. a + b is a followed by b, for lines and for bytes alike.
using Lines = std::vector<std::string>;
template <typename T>
std::vector<T> operator+(std::vector<T> a, const std::vector<T>& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

struct LogRecord {
  int priority;  // 4 info, 5 warning, 6 error
  std::string tag;
  std::string message;
  long tid = 0;  // the writing thread, for a daemon run as a process
  // "I ", "W ", "E "...: the priority's letter, as logcat shows it.
  std::string letter() const { return {"??VDIWEF"[priority & 7], ' '}; }
};

// The messages of one tag among records, in order.
inline std::vector<std::string> messages_of(const std::vector<LogRecord>& records,
                                            const std::string& tag) {
  std::vector<std::string> out;
  for (const LogRecord& r : records) {
    if (r.tag == tag) out.push_back(r.message);
  }
  return out;
}

// One at a time per process. Records of every thread are kept in order of logging.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<LogRecord> records() const;
  // Messages of one tag, in order.
  std::vector<std::string> messages(const std::string& tag = "KESTRELD") const;
  size_t count(const std::string& message, const std::string& tag = "KESTRELD") const;
  // Waits until at least n records of tag carry exactly message.
  bool wait_for(const std::string& message, std::chrono::milliseconds timeout, size_t n = 1,
                const std::string& tag = "KESTRELD") const;
  void clear();
};
