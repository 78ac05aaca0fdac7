#include "daemon_process.h"

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <condition_variable>
#include <mutex>
#include <thread>

#ifndef KESTRELD_BINARY
#error "KESTRELD_BINARY must name the daemon under test"
#endif

extern char** environ;

struct DaemonProcess::State {
  mutable std::mutex mutex;
  mutable std::condition_variable cond;
  std::vector<LogRecord> records;
  std::string output;
  bool last_open = false;  // the last record may still get continuation lines
  int read_fd = -1;
  std::thread reader;
  std::optional<int> status;
};

namespace {

int priority_of(char p) {
  switch (p) {
    case 'V':
      return 2;
    case 'D':
      return 3;
    case 'I':
      return 4;
    case 'W':
      return 5;
    case 'E':
      return 6;
    case 'F':
      return 7;
    default:
      return 0;
  }
}

// Parses "<tag> <P> <MM-DD> <HH:MM:SS> <pid> <tid> <message>" (pid and tid padded with blanks).
bool parse_record(const std::string& line, LogRecord* record) {
  size_t pos = 0;
  auto field = [&](std::string* out) {
    while (pos < line.size() && line[pos] == ' ') ++pos;
    const size_t start = pos;
    while (pos < line.size() && line[pos] != ' ') ++pos;
    if (pos == start) return false;
    *out = line.substr(start, pos - start);
    return true;
  };
  std::string tag, prio, date, time, pid, tid;
  if (!field(&tag) || !field(&prio) || !field(&date) || !field(&time) || !field(&pid) ||
      !field(&tid)) {
    return false;
  }
  if (prio.size() != 1 || priority_of(prio[0]) == 0 || date.size() != 5 || date[2] != '-' ||
      time.size() != 8 || time[2] != ':' || time[5] != ':' ||
      pid.find_first_not_of("0123456789") != std::string::npos ||
      tid.find_first_not_of("0123456789") != std::string::npos) {
    return false;
  }
  // Exactly one blank separates the thread id from the message, which may start with blanks.
  record->tag = tag;
  record->priority = priority_of(prio[0]);
  record->message = pos < line.size() ? line.substr(pos + 1) : "";
  record->tid = atol(tid.c_str());
  return true;
}

}  // namespace

DaemonProcess::DaemonProcess(const DaemonEnv& env, const std::string& path_prepend)
    : state_(new State) {
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) abort();
  std::map<std::string, std::string> merged;
  for (char** e = environ; *e != nullptr; ++e) {
    const char* eq = strchr(*e, '=');
    if (eq != nullptr) merged[std::string(*e, static_cast<size_t>(eq - *e))] = eq + 1;
  }
  for (const auto& kv : env) merged[kv.first] = kv.second;
  if (!path_prepend.empty()) merged["PATH"] = path_prepend + ":" + merged["PATH"];
  std::vector<std::string> strings;
  for (const auto& kv : merged) {
    if (!kv.second.empty()) strings.push_back(kv.first + "=" + kv.second);
  }
  std::vector<char*> envp;
  for (auto& s : strings) envp.push_back(s.data());
  envp.push_back(nullptr);

  pid_ = fork();
  if (pid_ == 0) {
    dup2(fds[1], 2);
    int devnull = open("/dev/null", O_RDWR);
    dup2(devnull, 0);
    dup2(devnull, 1);
    char* argv[] = {const_cast<char*>(KESTRELD_BINARY), nullptr};
    execve(KESTRELD_BINARY, argv, envp.data());
    _exit(127);
  }
  close(fds[1]);
  state_->read_fd = fds[0];
  State* st = state_;
  state_->reader = std::thread([st] {
    std::string pending;
    char buf[4096];
    for (;;) {
      ssize_t n = read(st->read_fd, buf, sizeof buf);
      if (n <= 0) break;
      std::lock_guard<std::mutex> lock(st->mutex);
      st->output.append(buf, static_cast<size_t>(n));
      pending.append(buf, static_cast<size_t>(n));
      size_t nl;
      while ((nl = pending.find('\n')) != std::string::npos) {
        std::string line = pending.substr(0, nl);
        pending.erase(0, nl + 1);
        LogRecord record;
        if (parse_record(line, &record)) {
          st->records.push_back(std::move(record));
          st->last_open = true;
        } else if (st->last_open && !st->records.empty()) {
          st->records.back().message += "\n" + line;
        }
      }
      st->cond.notify_all();
    }
    std::lock_guard<std::mutex> lock(st->mutex);
    st->cond.notify_all();
  });
}

DaemonProcess::~DaemonProcess() {
  kill_now();
  if (state_->reader.joinable()) state_->reader.join();
  close(state_->read_fd);
  delete state_;
}

std::vector<LogRecord> DaemonProcess::records() const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->records;
}

std::vector<std::string> DaemonProcess::messages(const std::string& tag) const {
  std::vector<std::string> out;
  std::lock_guard<std::mutex> lock(state_->mutex);
  for (const LogRecord& r : state_->records) {
    if (r.tag == tag) out.push_back(r.message);
  }
  return out;
}

bool DaemonProcess::wait_for(const std::string& message, std::chrono::milliseconds timeout,
                             size_t n, const std::string& tag) const {
  // A message ending in "\n" is only complete once the empty line after it has arrived, which
  // comes with the next record; so a trailing newline is matched against the text before it.
  std::unique_lock<std::mutex> lock(state_->mutex);
  return state_->cond.wait_for(lock, timeout, [&] {
    size_t seen = 0;
    for (const LogRecord& r : state_->records) {
      if (r.tag != tag) continue;
      if (r.message == message || (!message.empty() && message.back() == '\n' &&
                                   r.message == message.substr(0, message.size() - 1))) {
        ++seen;
      }
    }
    return seen >= n;
  });
}

std::string DaemonProcess::output() const {
  std::lock_guard<std::mutex> lock(state_->mutex);
  return state_->output;
}

std::optional<int> DaemonProcess::wait_exit(std::chrono::milliseconds timeout) {
  if (state_->status) return state_->status;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  for (;;) {
    int status = 0;
    pid_t r = waitpid(pid_, &status, WNOHANG);
    if (r == pid_) {
      state_->status = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
      return state_->status;
    }
    if (std::chrono::steady_clock::now() >= deadline) return std::nullopt;
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}

void DaemonProcess::kill_now() {
  if (state_->status || pid_ <= 0) return;
  ::kill(pid_, SIGKILL);
  wait_exit(std::chrono::milliseconds(5000));
}
