// SPDX-License-Identifier: Apache-2.0
#include "log_capture.h"

#include <android/log.h>

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <mutex>

namespace {

std::mutex g_mutex;
std::condition_variable g_cond;
std::vector<LogRecord>* g_records = nullptr;
std::atomic<bool> g_echo{false};

void capture_logger(const struct __android_logger_data* data, const char* message) {
  {
    std::lock_guard<std::mutex> lock(g_mutex);
    if (g_records != nullptr) {
      g_records->push_back({data->priority, data->tag != nullptr ? data->tag : "", message});
    }
  }
  g_cond.notify_all();
  if (g_echo) __android_log_stderr_logger(data, message);
}

}  // namespace

// liblog calls the logger under a lock of its own, and the logger takes g_mutex: so liblog is
// never called with g_mutex held.
LogCapture::LogCapture() {
  {
    std::lock_guard<std::mutex> lock(g_mutex);
    g_records = new std::vector<LogRecord>();
    const char* echo = getenv("KESTREL_TEST_ECHO_LOG");
    g_echo = echo != nullptr && echo[0] == '1';
  }
  __android_log_set_logger(capture_logger);
}

LogCapture::~LogCapture() {
  __android_log_set_logger(__android_log_stderr_logger);
  std::lock_guard<std::mutex> lock(g_mutex);
  delete g_records;
  g_records = nullptr;
}

std::vector<LogRecord> LogCapture::records() const {
  std::lock_guard<std::mutex> lock(g_mutex);
  return *g_records;
}

std::vector<std::string> LogCapture::messages(const std::string& tag) const {
  return messages_of(records(), tag);
}

size_t LogCapture::count(const std::string& message, const std::string& tag) const {
  const std::vector<std::string> m = messages(tag);
  return static_cast<size_t>(std::count(m.begin(), m.end(), message));
}

bool LogCapture::wait_for(const std::string& message, std::chrono::milliseconds timeout, size_t n,
                          const std::string& tag) const {
  std::unique_lock<std::mutex> lock(g_mutex);
  return g_cond.wait_for(lock, timeout, [&] {
    size_t seen = 0;
    for (const LogRecord& r : *g_records) {
      if (r.tag == tag && r.message == message) ++seen;
    }
    return seen >= n;
  });
}

void LogCapture::clear() {
  std::lock_guard<std::mutex> lock(g_mutex);
  g_records->clear();
}
