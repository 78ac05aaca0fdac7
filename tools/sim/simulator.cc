// The simulated sensor processor: one thread accepts connections on the Unix socket and reads
// every connection (poll), answering OPEN, recording each WRITE and running the request hook and
// the healthy phone for it. Records to the library are sent from whichever thread asks, under a
// per-connection write lock, so a record is never interleaved with another.
#include "tools/sim/simulator.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>

#include "byte_order.h"
#include "sensor1_host.h"
#include "tools/sim/healthy_phone.h"

namespace kestrel_sim {

namespace {

// A library thread that stops reading (a callback blocked for good) must not hang the sender.
constexpr Millis kSendTimeout(5000);

struct Conn {
  explicit Conn(int socket, sensor1_host::Link* in_process = nullptr)
      : fd(socket), link(in_process) {}
  std::mutex write_mu;  // guards fd: every send, and its closing
  int fd;
  sensor1_host::Link* const link;  // an in-process connection's, instead of fd
  // Guarded by State::mu.
  int number = 0;  // set when the OPEN handshake succeeds
  bool ended = false;
  uint64_t fault_acks = 0;
  // Connection thread only.
  bool answered_open = false;
  std::vector<uint8_t> rx;
};

using ConnPtr = std::shared_ptr<Conn>;

std::vector<uint8_t> message_record(sensor1_wire::Kind kind, const Header& header,
                                    const std::vector<uint8_t>& body) {
  return sensor1_wire::encode(sensor1_wire::message(kind, header, body.data(), body.size()));
}

bool send_with_timeout(int fd, const std::vector<uint8_t>& data, Millis timeout) {
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

}  // namespace

struct Simulator::State final : sensor1_host::Peer {
  explicit State(Simulator* owner, std::string socket_path, bool healthy_phone)
      : self(owner), path(std::move(socket_path)), healthy(healthy_phone), phone(*owner) {}

  Simulator* self;
  const std::string path;

  mutable std::mutex mu;
  std::condition_variable cv;
  bool healthy;
  int32_t refuse_result = 0;
  int refuse_count = 0;
  Millis hold_for{0};
  int hold_count = 0;
  ConnPtr held;                // the connection whose OPEN answer is held now
  uint64_t hold_releases = 0;  // release_held_opens() calls so far
  int listen_fd = -1;
  std::vector<int> retired_listen_fds;  // closed by the connection thread
  std::vector<ConnPtr> conns;           // every connection not yet cleaned up
  ConnPtr current;
  int opened = 0;
  std::vector<Request> history;
  std::deque<Request> pending;
  RequestHook request_hook;
  ConnectionHook connection_hook;
  bool stopping = false;

  int wake[2] = {-1, -1};
  std::thread io;
  std::thread::id io_id;
  HealthyPhone phone;

  void wake_io() {
    const uint8_t b = 1;
    ssize_t ignored = write(wake[1], &b, 1);
    (void)ignored;
  }

  // Binds and listens on path. Called with mu held.
  void open_listener() {
    const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr;
    memset(&addr, 0, sizeof addr);
    addr.sun_family = AF_UNIX;
    if (fd < 0 || path.size() >= sizeof addr.sun_path) {
      fprintf(stderr, "kestrel-sim: cannot listen on %s\n", path.c_str());
      if (fd >= 0) close(fd);
      return;
    }
    memcpy(addr.sun_path, path.c_str(), path.size());
    unlink(path.c_str());
    if (bind(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0 ||
        listen(fd, 16) != 0) {
      fprintf(stderr, "kestrel-sim: cannot listen on %s: %s\n", path.c_str(), strerror(errno));
      close(fd);
      return;
    }
    listen_fd = fd;
  }

  ConnPtr live_current() const { return current != nullptr && !current->ended ? current : nullptr; }

  ConnPtr current_conn() const {
    std::lock_guard<std::mutex> lock(mu);
    return live_current();
  }

  ConnPtr find(int number) const {
    for (const ConnPtr& c : conns) {
      if (c->number == number && !c->ended) return c;
    }
    return nullptr;
  }

  bool send_to(const ConnPtr& c, const std::vector<uint8_t>& rec) {
    if (c == nullptr) return false;
    // In process the record may reach the callback at once, which may write again: no lock.
    if (c->link != nullptr) return c->link->send(rec.data(), rec.size());
    std::lock_guard<std::mutex> lock(c->write_mu);
    return c->fd >= 0 && send_with_timeout(c->fd, rec, kSendTimeout);
  }

  void mark_ended(const ConnPtr& c) {
    {
      std::lock_guard<std::mutex> lock(mu);
      c->ended = true;
    }
    cv.notify_all();
  }

  // Holds the answer of an OPEN when asked to.
  void hold_open(const ConnPtr& c) {
    std::unique_lock<std::mutex> lock(mu);
    if (hold_count == 0) return;
    --hold_count;
    held = c;
    const uint64_t releases = hold_releases;
    cv.notify_all();
    cv.wait_for(lock, hold_for, [&] { return stopping || hold_releases != releases; });
    held.reset();
  }

  void handle_open(const ConnPtr& c) {
    if (c->answered_open) return;
    c->answered_open = true;
    hold_open(c);
    int32_t result = 0;
    int number = 0;
    ConnectionHook hook;
    bool sent;
    {
      // The connection is current before its answer goes out, so a test that saw its open
      // succeed finds it current; the write lock keeps every other record behind the answer.
      std::lock_guard<std::mutex> write_lock(c->write_mu);
      {
        std::lock_guard<std::mutex> lock(mu);
        if (refuse_count > 0) {
          --refuse_count;
          result = refuse_result;
        } else {
          number = ++opened;
          c->number = number;
          current = c;
          hook = connection_hook;
        }
      }
      const std::vector<uint8_t> rec =
          sensor1_wire::encode(sensor1_wire::result(sensor1_wire::kOpenResult, result));
      sent = c->link != nullptr ? c->link->send(rec.data(), rec.size())
                                : c->fd >= 0 && send_with_timeout(c->fd, rec, kSendTimeout);
    }
    if (!sent || result != 0) {
      if (c->link != nullptr) {
        end_in_process(c);
      } else {
        mark_ended(c);
      }
      return;
    }
    cv.notify_all();
    if (hook) hook(*self, number, true);
  }

  void handle_write(const ConnPtr& c, const sensor1_wire::Record& rec) {
    if (c->number == 0) return;
    Request req;
    req.connection = c->number;
    req.header = rec.header;
    req.body.assign(rec.body, rec.body + rec.header.msg_size);
    RequestHook hook;
    bool answer;
    {
      std::lock_guard<std::mutex> lock(mu);
      history.push_back(req);
      pending.push_back(req);
      hook = request_hook;
      answer = healthy;
    }
    cv.notify_all();
    if (hook) hook(*self, req);
    if (answer) phone.answer(req);
  }

  void handle_record(const ConnPtr& c, const sensor1_wire::Record& rec) {
    switch (rec.kind) {
      case sensor1_wire::kOpen:
        handle_open(c);
        break;
      case sensor1_wire::kWrite:
        handle_write(c, rec);
        break;
      case sensor1_wire::kFaultAck: {
        std::lock_guard<std::mutex> lock(mu);
        ++c->fault_acks;
        cv.notify_all();
        break;
      }
      default:
        break;
    }
  }

  // Handles every complete record in c->rx. False on a malformed stream.
  bool handle_records(const ConnPtr& c) {
    size_t pos = 0;
    for (;;) {
      sensor1_wire::Record rec;
      const long span = sensor1_wire::parse(c->rx.data() + pos, c->rx.size() - pos, &rec);
      if (span < 0) return false;
      if (span == 0) break;
      handle_record(c, rec);
      pos += static_cast<size_t>(span);
    }
    c->rx.erase(c->rx.begin(), c->rx.begin() + static_cast<long>(pos));
    return true;
  }

  // In process: the connection of a link, a new one for its OPEN.
  ConnPtr in_process_conn(sensor1_host::Link* link, bool open) {
    std::lock_guard<std::mutex> lock(mu);
    for (const ConnPtr& c : conns) {
      if (c->link == link) return c;
    }
    if (!open) return nullptr;
    conns.push_back(std::make_shared<Conn>(-1, link));
    return conns.back();
  }

  void receive(sensor1_host::Link* link, const uint8_t* record, size_t size) override {
    sensor1_wire::Record rec;
    const bool whole = sensor1_wire::parse(record, size, &rec) == static_cast<long>(size);
    const ConnPtr c = in_process_conn(link, whole && rec.kind == sensor1_wire::kOpen);
    if (c != nullptr && whole) handle_record(c, rec);
  }

  void closed(sensor1_host::Link* link) override {
    const ConnPtr c = in_process_conn(link, false);
    if (c != nullptr) end_in_process(c);
  }

  // An in-process connection has ended: it goes at once, with its hook.
  void end_in_process(const ConnPtr& c) {
    ConnectionHook hook;
    {
      std::lock_guard<std::mutex> lock(mu);
      c->ended = true;
      conns.erase(std::remove(conns.begin(), conns.end(), c), conns.end());
      if (c->number != 0) hook = connection_hook;
    }
    cv.notify_all();
    if (hook) hook(*self, c->number, false);
  }

  // Closes what was retired since the last pass: listening sockets and ended connections.
  void clean_up(std::vector<std::pair<int, ConnectionHook>>* ended_hooks) {
    std::vector<int> listeners;
    std::vector<ConnPtr> ended;
    {
      std::lock_guard<std::mutex> lock(mu);
      listeners.swap(retired_listen_fds);
      for (auto it = conns.begin(); it != conns.end();) {
        if ((*it)->ended) {
          ended.push_back(*it);
          if ((*it)->number != 0) ended_hooks->push_back({(*it)->number, connection_hook});
          it = conns.erase(it);
        } else {
          ++it;
        }
      }
    }
    for (int fd : listeners) close(fd);
    for (const ConnPtr& c : ended) {
      std::lock_guard<std::mutex> lock(c->write_mu);
      if (c->fd >= 0) close(c->fd);
      c->fd = -1;
    }
  }

  void run() {
    std::vector<pollfd> fds;
    std::vector<ConnPtr> polled;
    for (;;) {
      std::vector<std::pair<int, ConnectionHook>> ended_hooks;
      clean_up(&ended_hooks);
      for (auto& [number, hook] : ended_hooks) {
        if (hook) hook(*self, number, false);
      }
      fds.clear();
      polled.clear();
      fds.push_back({wake[0], POLLIN, 0});
      int listener;
      {
        std::lock_guard<std::mutex> lock(mu);
        if (stopping) return;
        listener = listen_fd;
        for (const ConnPtr& c : conns) {
          fds.push_back({c->fd, POLLIN, 0});
          polled.push_back(c);
        }
      }
      if (listener >= 0) fds.push_back({listener, POLLIN, 0});
      if (poll(fds.data(), fds.size(), -1) < 0) continue;
      if (fds[0].revents != 0) {
        uint8_t drain[64];
        ssize_t ignored = read(wake[0], drain, sizeof drain);
        (void)ignored;
      }
      for (size_t i = 0; i < polled.size(); ++i) {
        if (fds[i + 1].revents == 0) continue;
        const ConnPtr& c = polled[i];
        const int got = sensor1_wire::receive_available(c->fd, &c->rx);
        if (got != 0 && (got < 0 || !handle_records(c))) mark_ended(c);
      }
      if (listener >= 0 && fds.back().revents != 0) {
        const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd >= 0) {
          std::lock_guard<std::mutex> lock(mu);
          conns.push_back(std::make_shared<Conn>(fd));
        }
      }
    }
  }
};

Simulator::Simulator(std::string socket_path, bool healthy)
    : state_(std::make_unique<State>(this, std::move(socket_path), healthy)) {
  if (pipe2(state_->wake, O_CLOEXEC | O_NONBLOCK) != 0) {
    fprintf(stderr, "kestrel-sim: pipe: %s\n", strerror(errno));
    return;
  }
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->open_listener();
  }
  state_->io = std::thread([this] { state_->run(); });
  state_->io_id = state_->io.get_id();
}

Simulator::Simulator(InProcess, bool healthy) : state_(std::make_unique<State>(this, "", healthy)) {
  state_->phone.set_single_samples(true);
  sensor1_host::use_in_process_peer(state_.get());
}

Simulator::~Simulator() {
  if (state_->path.empty()) {
    // In process: new opens go to the socket again, and the library hears that every
    // connection of this simulator has ended.
    sensor1_host::use_in_process_peer(nullptr);
    std::vector<ConnPtr> conns;
    {
      std::lock_guard<std::mutex> lock(state_->mu);
      conns.swap(state_->conns);
      state_->current.reset();
    }
    for (const ConnPtr& c : conns) c->link->drop();
  }
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->stopping = true;
  }
  state_->cv.notify_all();  // a held OPEN answer goes out now
  if (state_->io.joinable()) {
    state_->wake_io();
    state_->io.join();
  }
  state_->phone.stop();
  // No thread of the simulator is left; the locks only keep the usual order (write lock first).
  std::vector<ConnPtr> conns;
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    conns.swap(state_->conns);
    state_->current.reset();
  }
  for (const ConnPtr& c : conns) {
    std::lock_guard<std::mutex> conn_lock(c->write_mu);
    if (c->fd >= 0) close(c->fd);
    c->fd = -1;
  }
  for (int fd : state_->retired_listen_fds) close(fd);
  if (state_->listen_fd >= 0) {
    close(state_->listen_fd);
    unlink(state_->path.c_str());
  }
  for (int fd : state_->wake) {
    if (fd >= 0) close(fd);
  }
}

const std::string& Simulator::socket_path() const {
  return state_->path;
}

HealthyPhone& Simulator::phone() {
  return state_->phone;
}

void Simulator::set_healthy(bool healthy) {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    state_->healthy = healthy;
  }
  if (!healthy) state_->phone.stop_streams();
}

void Simulator::refuse_opens(int32_t result, int count) {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->refuse_result = result;
  state_->refuse_count = count;
}

void Simulator::hold_opens(Millis hold, int count) {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->hold_for = hold;
  state_->hold_count = count;
}

void Simulator::release_held_opens() {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    ++state_->hold_releases;
  }
  state_->cv.notify_all();
}

bool Simulator::wait_for_held_open(Millis timeout) {
  std::unique_lock<std::mutex> lock(state_->mu);
  return state_->cv.wait_for(lock, timeout, [&] { return state_->held != nullptr; });
}

void Simulator::stop_listening() {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    if (state_->listen_fd < 0) return;
    // Without the file a connect fails at once; the socket itself is closed by the thread.
    unlink(state_->path.c_str());
    state_->retired_listen_fds.push_back(state_->listen_fd);
    state_->listen_fd = -1;
  }
  state_->wake_io();
}

void Simulator::resume_listening() {
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    if (state_->listen_fd >= 0) return;
    state_->open_listener();
  }
  state_->wake_io();
}

bool Simulator::listening() const {
  std::lock_guard<std::mutex> lock(state_->mu);
  return state_->listen_fd >= 0;
}

int Simulator::opened_connections() const {
  std::lock_guard<std::mutex> lock(state_->mu);
  return state_->opened;
}

int Simulator::current_connection() const {
  std::lock_guard<std::mutex> lock(state_->mu);
  const ConnPtr c = state_->live_current();
  return c != nullptr ? c->number : 0;
}

bool Simulator::wait_for_connection(Millis timeout) {
  std::unique_lock<std::mutex> lock(state_->mu);
  return state_->cv.wait_for(lock, timeout, [&] { return state_->live_current() != nullptr; });
}

bool Simulator::wait_for_disconnect(Millis timeout) {
  std::unique_lock<std::mutex> lock(state_->mu);
  return state_->cv.wait_for(lock, timeout, [&] { return state_->live_current() == nullptr; });
}

std::vector<Request> Simulator::requests() const {
  std::lock_guard<std::mutex> lock(state_->mu);
  return state_->history;
}

std::optional<Request> Simulator::next_request(Millis timeout) {
  std::unique_lock<std::mutex> lock(state_->mu);
  if (!state_->cv.wait_for(lock, timeout, [&] { return !state_->pending.empty(); })) {
    return std::nullopt;
  }
  Request req = std::move(state_->pending.front());
  state_->pending.pop_front();
  return req;
}

void Simulator::clear_requests() {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->history.clear();
  state_->pending.clear();
}

void Simulator::respond(Header header, const std::vector<uint8_t>& body) {
  state_->send_to(state_->current_conn(), message_record(sensor1_wire::kResponse, header, body));
}

void Simulator::indicate(Header header, const std::vector<uint8_t>& body) {
  state_->send_to(state_->current_conn(), message_record(sensor1_wire::kIndication, header, body));
}

bool Simulator::respond_to(int connection, Header header, const std::vector<uint8_t>& body) {
  ConnPtr c;
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    c = state_->find(connection);
  }
  return state_->send_to(c, message_record(sensor1_wire::kResponse, header, body));
}

bool Simulator::indicate_to(int connection, Header header, const std::vector<uint8_t>& body) {
  ConnPtr c;
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    c = state_->find(connection);
  }
  return state_->send_to(c, message_record(sensor1_wire::kIndication, header, body));
}

void Simulator::retry_open() {
  state_->send_to(state_->current_conn(),
                  sensor1_wire::encode(sensor1_wire::plain(sensor1_wire::kRetryOpen)));
}

namespace {

std::vector<uint8_t> callback_record(int32_t msg_type, bool with_header, bool with_body,
                                     const Header& header, const std::vector<uint8_t>& body) {
  sensor1_wire::Record rec =
      sensor1_wire::message(sensor1_wire::kCallback, header, body.data(), body.size());
  rec.value = msg_type;
  rec.flags = static_cast<uint8_t>((with_header ? sensor1_wire::kWithHeader : 0) |
                                   (with_body ? sensor1_wire::kWithBody : 0));
  return sensor1_wire::encode(rec);
}

}  // namespace

void Simulator::callback(int32_t msg_type, bool with_header, bool with_body, Header header,
                         const std::vector<uint8_t>& body) {
  state_->send_to(state_->current_conn(),
                  callback_record(msg_type, with_header, with_body, header, body));
}

bool Simulator::callback_to_held_open(int32_t msg_type, bool with_header, bool with_body,
                                      Header header, const std::vector<uint8_t>& body) {
  ConnPtr c;
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    c = state_->held;
  }
  return state_->send_to(c, callback_record(msg_type, with_header, with_body, header, body));
}

bool Simulator::fault(FaultOp op, int32_t result, uint32_t count, Millis timeout) {
  if (std::this_thread::get_id() == state_->io_id) return false;
  ConnPtr c;
  uint64_t before;
  {
    std::lock_guard<std::mutex> lock(state_->mu);
    c = state_->live_current();
    if (c == nullptr) return false;
    before = c->fault_acks;
  }
  sensor1_wire::Record rec = sensor1_wire::result(sensor1_wire::kFault, result);
  rec.op = static_cast<uint8_t>(op);
  rec.count = count;
  if (!state_->send_to(c, sensor1_wire::encode(rec))) return false;
  if (c->link != nullptr) return true;  // applied before the library call in progress returns
  std::unique_lock<std::mutex> lock(state_->mu);
  return state_->cv.wait_for(lock, timeout, [&] { return c->fault_acks > before; });
}

void Simulator::drop_connection() {
  const ConnPtr c = state_->current_conn();
  if (c == nullptr) return;
  if (c->link != nullptr) {
    state_->end_in_process(c);
    c->link->drop();
    return;
  }
  {
    std::lock_guard<std::mutex> lock(c->write_mu);
    if (c->fd >= 0) shutdown(c->fd, SHUT_RDWR);
  }
  state_->mark_ended(c);
  state_->wake_io();
}

void Simulator::set_request_hook(RequestHook hook) {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->request_hook = std::move(hook);
}

void Simulator::set_connection_hook(ConnectionHook hook) {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->connection_hook = std::move(hook);
}

std::vector<uint8_t> test_indication_body(uint8_t sensor_id, int32_t test_type, uint32_t result,
                                          uint8_t error_valid, uint8_t error_code,
                                          const std::vector<int32_t>& words) {
  std::vector<uint8_t> b(84, 0);
  store_u8(b.data(), 0, sensor_id);
  store_i32(b.data(), 4, test_type);
  store_u32(b.data(), 8, result);
  store_u8(b.data(), 12, error_valid);
  store_u8(b.data(), 13, error_code);
  for (size_t i = 0; i < words.size() && i < 16; ++i) store_i32(b.data(), 20 + 4 * i, words[i]);
  return b;
}

std::vector<uint8_t> sample_indication_body(uint8_t sensor_id, uint8_t data_type, int32_t x,
                                            int32_t y, int32_t z) {
  std::vector<uint8_t> b(24, 0);
  store_u8(b.data(), 8, sensor_id);
  store_u8(b.data(), 9, data_type);
  store_i32(b.data(), 12, x);
  store_i32(b.data(), 16, y);
  store_i32(b.data(), 20, z);
  return b;
}

std::vector<uint8_t> daf_indication_body(uint8_t code, uint8_t valid, uint32_t length,
                                         const std::array<int32_t, 6>& data) {
  std::vector<uint8_t> b(32, 0);
  store_u8(b.data(), 0, code);
  store_u8(b.data(), 1, valid);
  store_u32(b.data(), 4, length);
  for (size_t i = 0; i < data.size(); ++i) store_i32(b.data(), 8 + 4 * i, data[i]);
  return b;
}

std::vector<uint8_t> common_response_body(uint8_t result, uint8_t error, size_t size) {
  std::vector<uint8_t> b(std::max<size_t>(size, 2), 0);
  b[0] = result;
  b[1] = error;
  return b;
}

}  // namespace kestrel_sim
