// SPDX-License-Identifier: Apache-2.0
#include "tools/sim/transport.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <mutex>
#include <thread>

#include "sensor1_host.h"

namespace kestrel_sim {

namespace {

using Millis = std::chrono::milliseconds;

// A library thread that stops reading (a callback blocked for good) must not hang the sender.
constexpr Millis kSendTimeout(5000);

bool send_with_timeout(int fd, const Bytes& data, Millis timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  size_t done = 0;
  while (done < data.size()) {
    const ssize_t n = send(fd, data.data() + done, data.size() - done, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      done += static_cast<size_t>(n);
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
      const auto left =
          std::chrono::duration_cast<Millis>(deadline - std::chrono::steady_clock::now());
      if (left.count() <= 0) break;
      pollfd p = {fd, POLLOUT, 0};
      poll(&p, 1, static_cast<int>(left.count()));
      continue;
    }
    break;
  }
  if (done == data.size()) return true;
  // Half a record would corrupt the stream: end the connection instead.
  if (done > 0) shutdown(fd, SHUT_RDWR);
  return false;
}

// A connection on the socket. The descriptor is closed with the channel, once nobody (the reading
// thread included) holds the connection any more.
class SocketChannel final : public Channel {
 public:
  explicit SocketChannel(int fd) : fd_(fd) {}
  ~SocketChannel() override { close(fd_); }
  int fd() const { return fd_; }

  bool send_made(const std::function<std::vector<Bytes>()>& make) override {
    std::lock_guard<std::mutex> lock(mu_);
    for (const Bytes& record : make()) {
      if (!send_with_timeout(fd_, record, kSendTimeout)) return false;
    }
    return true;
  }
  void hang_up() override {
    std::lock_guard<std::mutex> lock(mu_);
    shutdown(fd_, SHUT_RDWR);
  }
  bool acknowledges_faults() const override { return true; }

 private:
  std::mutex mu_;  // one sender at a time
  const int fd_;
};

// A connection of the library in this process. A record may reach the callback at once, which
// may write again on this thread: no lock.
class LinkChannel final : public Channel {
 public:
  explicit LinkChannel(sensor1_host::Link* link) : link_(link) {}

  bool send_made(const std::function<std::vector<Bytes>()>& make) override {
    for (const Bytes& record : make()) {
      if (!link_->send(record.data(), record.size())) return false;
    }
    return true;
  }
  void hang_up() override { link_->drop(); }
  bool acknowledges_faults() const override { return false; }

 private:
  sensor1_host::Link* const link_;
};

class SocketTransport final : public Transport {
 public:
  SocketTransport(ConnectionSink& sink, std::string path) : sink_(sink), path_(std::move(path)) {}

  ~SocketTransport() override {
    for (int fd : retired_) close(fd);
    if (listen_fd_ >= 0) {
      close(listen_fd_);
      unlink(path_.c_str());
    }
    for (int fd : wake_) {
      if (fd >= 0) close(fd);
    }
  }

  void start() override {
    if (pipe2(wake_, O_CLOEXEC | O_NONBLOCK) != 0) {
      fprintf(stderr, "kestrel-sim: pipe: %s\n", strerror(errno));
      return;
    }
    {
      std::lock_guard<std::mutex> lock(mu_);
      open_listener();
    }
    io_ = std::thread([this] { run(); });
    io_id_ = io_.get_id();
  }

  void stop() override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      stopping_ = true;
    }
    if (!io_.joinable()) return;
    wake();
    io_.join();
  }

  void retire(const ConnPtr&) override { wake(); }
  bool on_reading_thread() const override { return std::this_thread::get_id() == io_id_; }

  bool listening() const override {
    std::lock_guard<std::mutex> lock(mu_);
    return listen_fd_ >= 0;
  }

  void stop_listening() override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (listen_fd_ < 0) return;
      // Without the file a connect fails at once; the socket itself is closed by the thread.
      unlink(path_.c_str());
      retired_.push_back(listen_fd_);
      listen_fd_ = -1;
    }
    wake();
  }

  void resume_listening() override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (listen_fd_ >= 0) return;
      open_listener();
    }
    wake();
  }

 private:
  struct Polled {
    ConnPtr conn;
    SocketChannel* channel;
    Bytes rx;  // received, not yet a whole record
  };

  void wake() {
    const uint8_t b = 1;
    ssize_t ignored = write(wake_[1], &b, 1);
    (void)ignored;
  }

  // Binds and listens on path. Called with mu_ held.
  void open_listener() {
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr;
    memset(&addr, 0, sizeof addr);
    addr.sun_family = AF_UNIX;
    if (fd < 0 || path_.size() >= sizeof addr.sun_path) {
      fprintf(stderr, "kestrel-sim: cannot listen on %s\n", path_.c_str());
      if (fd >= 0) close(fd);
      return;
    }
    memcpy(addr.sun_path, path_.c_str(), path_.size());
    unlink(path_.c_str());
    if (bind(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0 ||
        listen(fd, 16) != 0) {
      fprintf(stderr, "kestrel-sim: cannot listen on %s: %s\n", path_.c_str(), strerror(errno));
      close(fd);
      return;
    }
    listen_fd_ = fd;
  }

  // Reaps the ended connections and closes the retired listeners; the listener to poll, or -1
  // when the transport stops.
  int tidy(bool* stopping) {
    for (auto it = conns_.begin(); it != conns_.end();) {
      if (sink_.ended(it->conn)) {
        sink_.reap(it->conn);
        it = conns_.erase(it);
      } else {
        ++it;
      }
    }
    std::vector<int> retired;
    int listener;
    {
      std::lock_guard<std::mutex> lock(mu_);
      retired.swap(retired_);
      listener = listen_fd_;
      *stopping = stopping_;
    }
    for (int fd : retired) close(fd);
    return listener;
  }

  // Handles every whole record received on p. False on a malformed stream.
  bool handle_received(Polled& p) {
    size_t pos = 0;
    for (;;) {
      sensor1_wire::Record rec;
      const long span = sensor1_wire::parse(p.rx.data() + pos, p.rx.size() - pos, &rec);
      if (span < 0) return false;
      if (span == 0) break;
      sink_.handle(p.conn, rec);
      pos += static_cast<size_t>(span);
    }
    p.rx.erase(p.rx.begin(), p.rx.begin() + static_cast<long>(pos));
    return true;
  }

  void run() {
    std::vector<pollfd> fds;
    for (;;) {
      bool stopping;
      const int listener = tidy(&stopping);
      if (stopping) return;
      fds.assign(1, {wake_[0], POLLIN, 0});
      for (const Polled& p : conns_) fds.push_back({p.channel->fd(), POLLIN, 0});
      if (listener >= 0) fds.push_back({listener, POLLIN, 0});
      if (poll(fds.data(), fds.size(), -1) < 0) continue;
      if (fds[0].revents != 0) {
        uint8_t drain[64];
        ssize_t ignored = read(wake_[0], drain, sizeof drain);
        (void)ignored;
      }
      const size_t polled = conns_.size();
      for (size_t i = 0; i < polled; ++i) {
        if (fds[i + 1].revents == 0) continue;
        Polled& p = conns_[i];
        const int got = sensor1_wire::receive_available(p.channel->fd(), &p.rx);
        if (got != 0 && (got < 0 || !handle_received(p))) sink_.end(p.conn);
      }
      if (listener >= 0 && fds.back().revents != 0) accept_one(listener);
    }
  }

  void accept_one(int listener) {
    const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) return;
    auto channel = std::make_unique<SocketChannel>(fd);
    SocketChannel* raw = channel.get();
    conns_.push_back({sink_.add(std::move(channel)), raw, {}});
  }

  ConnectionSink& sink_;
  const std::string path_;
  mutable std::mutex mu_;  // guards what follows
  int listen_fd_ = -1;
  std::vector<int> retired_;  // listeners closed by the reading thread
  bool stopping_ = false;
  // The reading thread's own.
  std::vector<Polled> conns_;
  int wake_[2] = {-1, -1};
  std::thread io_;
  std::thread::id io_id_;
};

class InProcessTransport final : public Transport, public sensor1_host::Peer {
 public:
  explicit InProcessTransport(ConnectionSink& sink) : sink_(sink) {}

  void start() override { sensor1_host::use_in_process_peer(this); }

  // New opens go to the socket again, and nothing more is taken from the links already open.
  void stop() override {
    sensor1_host::use_in_process_peer(nullptr);
    std::lock_guard<std::mutex> lock(mu_);
    stopped_ = true;
    links_.clear();
  }

  // An in-process connection goes at once, on the thread that ended it.
  void retire(const ConnPtr& conn) override {
    {
      std::lock_guard<std::mutex> lock(mu_);
      links_.erase(std::remove_if(links_.begin(), links_.end(),
                                  [&](const auto& l) { return l.second == conn; }),
                   links_.end());
    }
    sink_.reap(conn);
  }

  bool on_reading_thread() const override { return false; }
  bool listening() const override { return false; }
  void stop_listening() override {}
  void resume_listening() override {}

  void receive(sensor1_host::Link* link, const uint8_t* record, size_t size) override {
    sensor1_wire::Record rec;
    if (sensor1_wire::parse(record, size, &rec) != static_cast<long>(size)) return;
    const ConnPtr c = conn_of(link, rec.kind == sensor1_wire::kOpen);
    if (c != nullptr) sink_.handle(c, rec);
  }

  void closed(sensor1_host::Link* link) override {
    const ConnPtr c = conn_of(link, false);
    if (c != nullptr) sink_.end(c);
  }

 private:
  // The connection of a link; a new one for its OPEN.
  ConnPtr conn_of(sensor1_host::Link* link, bool open) {
    {
      std::lock_guard<std::mutex> lock(mu_);
      if (stopped_) return nullptr;
      for (const auto& l : links_) {
        if (l.first == link) return l.second;
      }
      if (!open) return nullptr;
    }
    ConnPtr c = sink_.add(std::make_unique<LinkChannel>(link));
    std::lock_guard<std::mutex> lock(mu_);
    links_.push_back({link, c});
    return c;
  }

  ConnectionSink& sink_;
  std::mutex mu_;  // guards what follows
  bool stopped_ = false;
  std::vector<std::pair<sensor1_host::Link*, ConnPtr>> links_;
};

}  // namespace

std::unique_ptr<Transport> socket_transport(ConnectionSink& sink, const std::string& path) {
  return std::make_unique<SocketTransport>(sink, path);
}

std::unique_ptr<Transport> in_process_transport(ConnectionSink& sink) {
  return std::make_unique<InProcessTransport>(sink);
}

}  // namespace kestrel_sim
