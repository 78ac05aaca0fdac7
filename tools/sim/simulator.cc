// SPDX-License-Identifier: Apache-2.0
// The simulated sensor processor's core: the connections, whichever transport carries them
// (transport.h), the OPEN handshake with its knobs, every WRITE recorded and handed to the request
// hook and the healthy phone. Records to the library are sent from whichever thread asks, through
// the connection's channel, so a record is never interleaved with another.
#include "tools/sim/simulator.h"

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <mutex>
#include <thread>

#include "tools/sim/healthy_phone.h"
#include "tools/sim/transport.h"

namespace kestrel_sim {

struct Conn {
  explicit Conn(std::unique_ptr<Channel> far_end) : channel(std::move(far_end)) {}
  const std::unique_ptr<Channel> channel;
  // Guarded by State::mu.
  int number = 0;  // set when the OPEN handshake succeeds
  bool ended = false;
  uint64_t fault_acks = 0;
  // The reading thread's only.
  bool answered_open = false;
};

namespace {

Bytes message_record(sensor1_wire::Kind kind, const Header& header, const Bytes& body) {
  return sensor1_wire::encode(sensor1_wire::message(kind, header, body.data(), body.size()));
}

Bytes callback_record(int32_t msg_type, bool with_header, bool with_body, const Header& header,
                      const Bytes& body) {
  sensor1_wire::Record rec =
      sensor1_wire::message(sensor1_wire::kCallback, header, body.data(), body.size());
  rec.value = msg_type;
  rec.flags = static_cast<uint8_t>((with_header ? sensor1_wire::kWithHeader : 0) |
                                   (with_body ? sensor1_wire::kWithBody : 0));
  return sensor1_wire::encode(rec);
}

}  // namespace

struct Simulator::State final : ConnectionSink {
  State(Simulator* owner, std::string socket_path, bool healthy_phone)
      : self(owner), path(std::move(socket_path)), healthy(healthy_phone), phone(*owner) {}

  Simulator* self;
  const std::string path;
  std::unique_ptr<Transport> transport;

  mutable std::mutex mu;
  std::condition_variable cv;
  bool healthy;
  int32_t refuse_result = 0;
  int refuse_count = 0;
  Millis hold_for{0};
  int hold_count = 0;
  ConnPtr held;                // the connection whose OPEN answer is held now
  uint64_t hold_releases = 0;  // release_held_opens() calls so far
  std::vector<ConnPtr> conns;  // every connection not yet reaped
  ConnPtr current;
  int opened = 0;
  std::vector<Request> history;
  std::deque<Request> pending;
  RequestHook request_hook;
  ConnectionHook connection_hook;
  bool stopping = false;
  HealthyPhone phone;

  ConnPtr live_current() const { return current != nullptr && !current->ended ? current : nullptr; }

  ConnPtr current_conn() const {
    std::lock_guard<std::mutex> lock(mu);
    return live_current();
  }

  ConnPtr find(int number) const {
    std::lock_guard<std::mutex> lock(mu);
    for (const ConnPtr& c : conns) {
      if (c->number == number && !c->ended) return c;
    }
    return nullptr;
  }

  bool send_to(const ConnPtr& c, const Bytes& record) {
    return c != nullptr && c->channel->send(record);
  }

  ConnPtr add(std::unique_ptr<Channel> channel) override {
    auto c = std::make_shared<Conn>(std::move(channel));
    std::lock_guard<std::mutex> lock(mu);
    conns.push_back(c);
    return c;
  }

  bool ended(const ConnPtr& c) const override {
    std::lock_guard<std::mutex> lock(mu);
    return c->ended;
  }

  void end(const ConnPtr& c) override {
    {
      std::lock_guard<std::mutex> lock(mu);
      if (c->ended) return;
      c->ended = true;
    }
    cv.notify_all();
    transport->retire(c);
  }

  void reap(const ConnPtr& c) override {
    ConnectionHook hook;
    {
      std::lock_guard<std::mutex> lock(mu);
      const auto it = std::find(conns.begin(), conns.end(), c);
      if (it == conns.end()) return;  // gone with the simulator's teardown
      conns.erase(it);
      if (c->number != 0) hook = connection_hook;
    }
    if (hook) hook(*self, c->number, false);
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

  // The OPEN's result, decided as its answer goes out: a successful open makes the connection
  // current first, so a test that saw its open succeed finds it current, and the channel's order
  // keeps every other record behind the answer.
  int32_t open_result(const ConnPtr& c) {
    std::lock_guard<std::mutex> lock(mu);
    if (refuse_count > 0) {
      --refuse_count;
      return refuse_result;
    }
    c->number = ++opened;
    current = c;
    return 0;
  }

  void handle_open(const ConnPtr& c) {
    if (c->answered_open) return;
    c->answered_open = true;
    hold_open(c);
    int32_t result = 0;
    const bool sent = c->channel->send_made([&] {
      result = open_result(c);
      return std::vector<Bytes>{
          sensor1_wire::encode(sensor1_wire::result(sensor1_wire::kOpenResult, result))};
    });
    if (!sent || result != 0) {
      end(c);
      return;
    }
    cv.notify_all();
    ConnectionHook hook;
    {
      std::lock_guard<std::mutex> lock(mu);
      hook = connection_hook;
    }
    if (hook) hook(*self, c->number, true);
  }

  void handle_write(const ConnPtr& c, const sensor1_wire::Record& rec) {
    Request req;
    RequestHook hook;
    bool answer;
    {
      std::lock_guard<std::mutex> lock(mu);
      if (c->number == 0) return;
      req.connection = c->number;
      req.header = rec.header;
      req.body.assign(rec.body, rec.body + rec.header.msg_size);
      history.push_back(req);
      pending.push_back(req);
      hook = request_hook;
      answer = healthy;
    }
    cv.notify_all();
    if (hook) hook(*self, req);
    if (answer) phone.answer(req);
  }

  void handle(const ConnPtr& c, const sensor1_wire::Record& rec) override {
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

  // The one teardown: nothing more is read, the phone stops, and the library sees every
  // connection still open end (with no hook).
  void tear_down() {
    {
      std::lock_guard<std::mutex> lock(mu);
      stopping = true;
    }
    cv.notify_all();  // a held OPEN answer goes out now
    transport->stop();
    phone.stop();
    std::vector<ConnPtr> left;
    {
      std::lock_guard<std::mutex> lock(mu);
      left.swap(conns);
      current.reset();
    }
    for (const ConnPtr& c : left) c->channel->hang_up();
    left.clear();
    transport.reset();
  }
};

Simulator::Simulator(std::string socket_path, bool healthy)
    : state_(std::make_unique<State>(this, socket_path, healthy)) {
  state_->transport = socket_transport(*state_, state_->path);
  state_->transport->start();
}

Simulator::Simulator(InProcess, bool healthy) : state_(std::make_unique<State>(this, "", healthy)) {
  state_->phone.set_single_samples(true);
  state_->transport = in_process_transport(*state_);
  state_->transport->start();
}

Simulator::~Simulator() {
  state_->tear_down();
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
  state_->transport->stop_listening();
}

void Simulator::resume_listening() {
  state_->transport->resume_listening();
}

bool Simulator::listening() const {
  return state_->transport->listening();
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
  return state_->send_to(state_->find(connection),
                         message_record(sensor1_wire::kResponse, header, body));
}

bool Simulator::indicate_to(int connection, Header header, const std::vector<uint8_t>& body) {
  return state_->send_to(state_->find(connection),
                         message_record(sensor1_wire::kIndication, header, body));
}

void Simulator::retry_open() {
  state_->send_to(state_->current_conn(),
                  sensor1_wire::encode(sensor1_wire::plain(sensor1_wire::kRetryOpen)));
}

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
  if (state_->transport->on_reading_thread()) return false;
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
  // In process the fault is in force before the library call in progress returns.
  if (!c->channel->acknowledges_faults()) return true;
  std::unique_lock<std::mutex> lock(state_->mu);
  return state_->cv.wait_for(lock, timeout, [&] { return c->fault_acks > before; });
}

void Simulator::drop_connection() {
  const ConnPtr c = state_->current_conn();
  if (c == nullptr) return;
  state_->end(c);
  c->channel->hang_up();
}

void Simulator::set_request_hook(RequestHook hook) {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->request_hook = std::move(hook);
}

void Simulator::set_connection_hook(ConnectionHook hook) {
  std::lock_guard<std::mutex> lock(state_->mu);
  state_->connection_hook = std::move(hook);
}

}  // namespace kestrel_sim
