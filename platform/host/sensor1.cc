// SPDX-License-Identifier: Apache-2.0
// The sensor1 client library of the host build. Each connection is a Unix stream socket to
// kestrel-sim at KESTREL_SENSOR1_SOCKET carrying the records of sensor1_wire.h.
//
// One library thread, started by the first successful open, polls every open connection and
// calls each connection's callback, one message at a time, in arrival order. No library lock is
// held while a callback runs, so a callback may block, open a new connection or close any
// connection, its own included.
//
// Like a phone's client library, sensor1_close does not return while a callback is running on
// the connection it closes: it waits for that callback to return (and logs "close waits for a
// callback" first, so a test knows it got there). A close on the library's own thread (from
// inside a callback) goes through at once.
//
// The callback is registered before the OPEN handshake: records the simulator sends ahead of its
// OPEN_RESULT reach the callback, on the library thread, while sensor1_open is still waiting.
//
// With sensor1_host::use_in_process_peer, connections reach a peer in this process instead, with
// the same records and the same handle rules, and no library thread: what the peer sends is
// delivered on the thread of the library call that made it send (a write's response and
// indications before the write returns), or on the peer's own thread, one message at a time
// across every connection.
//
// A handle is a number, not an address: the connection's slot and the generation of that slot,
// so a late call on a closed handle gets an error instead of reaching whatever uses the slot
// next, and is counted (sensor1_host_stale_handle_calls). Connection records are never freed; a
// closed one whose descriptor is gone is used again by a later open, so a daemon that reconnects
// for ever keeps a bounded set of them. The file descriptor of a connection is closed only by the
// library thread (or by the failed open that created it), never while it may sit in the thread's
// poll set.
#include "sensor1.h"

#include <android/log.h>
#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <deque>
#include <mutex>
#include <vector>

#include "host_env.h"
#include "sensor1_host.h"
#include "sensor1_wire.h"

namespace {

using sensor1_wire::FaultOp;
using sensor1_wire::Record;

constexpr char kTag[] = "libsensor1";
// How long an open waits for OPEN_RESULT before it gives up with 11.
constexpr int kHandshakeTimeoutSeconds = 10;
constexpr int kOpCount = 3;

enum class LinkState { kOpening, kOpen, kEnded, kClosed };

struct Fault {
  int result = 0;
  uint32_t count = 0;
};

struct Connection;

// The far end's side of an in-process connection, one per connection record, used again with
// it. Its fields are guarded by g_inbox_mu.
class InProcessLink final : public sensor1_host::Link {
 public:
  explicit InProcessLink(Connection* c) : connection(c) {}
  bool send(const uint8_t* record, size_t size) override;
  void drop() override;

  Connection* const connection;
  sensor1_host::Peer* peer = nullptr;
  bool opening = true;  // records wait until sensor1_open has returned
  bool answered = false;
  int32_t open_result = SENSOR1_EWOULDBLOCK;
  bool ended = false;  // closed by the library or dropped by the peer
};

struct Connection {
  size_t slot = 0;                // its index in g_connections
  InProcessLink* link = nullptr;  // set, for good, on a record of in-process connections
  sensor1_notify_data_cb_t cb = nullptr;
  intptr_t cb_data = 0;

  // Guarded by io_lock: the descriptor (-1 once closed) and every write to it, so records of
  // different threads never interleave and the descriptor is never closed under a writer.
  pthread_mutex_t io_lock = PTHREAD_MUTEX_INITIALIZER;
  int fd = -1;

  // Guarded by g_lock.
  uint64_t generation = 0;  // opens of this record so far
  bool reusable = false;    // closed and its descriptor closed: a later open may take it
  LinkState state = LinkState::kOpen;
  bool in_callback = false;  // the library thread is inside this connection's callback
  bool fd_to_close = false;  // closed or ended, descriptor still to be closed by the thread
  Fault faults[kOpCount];
  std::deque<std::vector<uint8_t>> early;  // records that came ahead of OPEN_RESULT

  // Library thread only: bytes received and not yet delivered.
  std::vector<uint8_t> rx;
};

// Lock order: a handle's io_lock before g_inbox_mu before g_lock.
pthread_mutex_t g_lock = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t g_callback_returned = PTHREAD_COND_INITIALIZER;  // with g_lock
thread_local bool t_library_thread = false;
// Guarded by g_lock; never freed, nor destroyed at exit while the library thread may use it.
std::vector<Connection*>& g_connections = *new std::vector<Connection*>;
pthread_once_t g_thread_once = PTHREAD_ONCE_INIT;
int g_wake[2] = {-1, -1};  // pipe that wakes the library thread when the set changes
bool g_thread_started = false;
std::atomic<long> g_outstanding{0};
std::atomic<long> g_stale_calls{0};

// The in-process way: the peer new connections reach, and the records peers have sent, in
// arrival order over every connection (an empty record is the end of its connection).
std::atomic<sensor1_host::Peer*> g_peer{nullptr};
struct Inbound {
  Connection* connection;
  uint64_t generation;
  std::vector<uint8_t> record;
};
std::mutex g_inbox_mu;
std::deque<Inbound> g_inbox;             // guarded by g_inbox_mu
std::atomic<bool> g_delivering{false};   // a thread is delivering from g_inbox
thread_local bool t_delivering = false;  // ... and it is this one

void log_line(const char* fmt, int value) {
  __android_log_print(ANDROID_LOG_INFO, kTag, fmt, value);
}

// Exactly size bytes, so a read past a body is a read past its block.
void* alloc_body(size_t size) {
  void* p = size > 0 ? calloc(1, size) : malloc(0);
  if (p != nullptr) g_outstanding.fetch_add(1);
  return p;
}

void release_body(void* body) {
  if (body == nullptr) return;
  free(body);
  g_outstanding.fetch_sub(1);
}

// A call on a handle that is not empty and not an open connection's: closed, or of a record
// used again since. On a phone that handle may point at freed memory.
void count_stale(const char* call, sensor1_handle_s* handle) {
  if (handle == nullptr) return;
  g_stale_calls.fetch_add(1);
  __android_log_print(ANDROID_LOG_ERROR, kTag, "%s on a closed handle %p", call,
                      static_cast<void*>(handle));
}

void wake_thread() {
  const uint8_t b = 1;
  ssize_t ignored = write(g_wake[1], &b, 1);
  (void)ignored;
}

// Consumes one fault of op on h, if one is armed. Called with g_lock held.
bool take_fault(Connection* h, FaultOp op, int* result) {
  Fault& f = h->faults[static_cast<int>(op) - 1];
  if (f.count == 0) return false;
  --f.count;
  *result = f.result;
  return true;
}

const char* op_name(FaultOp op) {
  static const char* const kNames[] = {"", "alloc", "write", "close"};
  return kNames[static_cast<int>(op)];
}

// Runs h's callback on the library thread; a close of h waits until it has returned. The check
// that h is not closed and the mark that its callback runs are one step under g_lock, so a close
// that returns between the caller's own check and this one is never followed by a callback.
void run_callback(Connection* h, sensor1_msg_header_s* hdr, int type, void* body) {
  pthread_mutex_lock(&g_lock);
  if (h->state == LinkState::kClosed) {
    pthread_mutex_unlock(&g_lock);
    if (body != nullptr) release_body(body);
    return;
  }
  h->in_callback = true;
  pthread_mutex_unlock(&g_lock);
  h->cb(h->cb_data, hdr, type, body);
  pthread_mutex_lock(&g_lock);
  h->in_callback = false;
  pthread_cond_broadcast(&g_callback_returned);
  pthread_mutex_unlock(&g_lock);
}

void deliver_inbox();

bool link_open(Connection* h) {
  std::lock_guard<std::mutex> lock(g_inbox_mu);
  return !h->link->ended;
}

// Hands one record to h's peer, then delivers what it answered. False when the link has ended.
bool send_in_process(Connection* h, const std::vector<uint8_t>& bytes) {
  if (!link_open(h)) return false;
  h->link->peer->receive(h->link, bytes.data(), bytes.size());
  deliver_inbox();
  return true;
}

// Sends one record on h (under its io_lock on a socket). False when the connection is gone.
bool send_record(Connection* h, const Record& rec) {
  const std::vector<uint8_t> bytes = sensor1_wire::encode(rec);
  if (h->link != nullptr) return send_in_process(h, bytes);
  pthread_mutex_lock(&h->io_lock);
  const bool ok = h->fd >= 0 && sensor1_wire::send_all(h->fd, bytes.data(), bytes.size());
  pthread_mutex_unlock(&h->io_lock);
  return ok;
}

// The connection ended without sensor1_close: it is dead from now on and its callback hears of
// it once.
void end_connection(Connection* h) {
  pthread_mutex_lock(&g_lock);
  const bool report = h->state == LinkState::kOpen;
  if (report) {
    h->state = LinkState::kEnded;
    h->fd_to_close = true;
  }
  pthread_mutex_unlock(&g_lock);
  h->rx.clear();
  if (!report) return;
  __android_log_print(ANDROID_LOG_INFO, kTag, "connection ended, BROKEN_PIPE");
  sensor1_msg_header_s hdr;
  memset(&hdr, 0, sizeof hdr);
  run_callback(h, &hdr, SENSOR1_MSG_TYPE_BROKEN_PIPE, nullptr);
}

bool is_open(Connection* h) {
  pthread_mutex_lock(&g_lock);
  const bool open = h->state == LinkState::kOpen;
  pthread_mutex_unlock(&g_lock);
  return open;
}

// A body of the library's allocator holding the record's body.
void* copy_body(const Record& rec) {
  void* body = alloc_body(rec.header.msg_size);
  if (body != nullptr && rec.header.msg_size > 0) memcpy(body, rec.body, rec.header.msg_size);
  return body;
}

void apply_fault(Connection* h, const Record& rec) {
  if (rec.op >= 1 && rec.op <= kOpCount) {
    const FaultOp op = static_cast<FaultOp>(rec.op);
    pthread_mutex_lock(&g_lock);
    h->faults[rec.op - 1].result = rec.value;
    h->faults[rec.op - 1].count = rec.count;
    pthread_mutex_unlock(&g_lock);
    __android_log_print(ANDROID_LOG_INFO, kTag, "fault %s -> %d count %u", op_name(op), rec.value,
                        rec.count);
  }
  Record ack = sensor1_wire::plain(sensor1_wire::kFaultAck);
  ack.op = rec.op;
  send_record(h, ack);
}

// Hands one record of the simulator to h's callback (or applies it).
void deliver(Connection* h, const Record& rec) {
  sensor1_msg_header_s hdr;
  memset(&hdr, 0, sizeof hdr);
  hdr.service_number = rec.header.service;
  hdr.msg_id = rec.header.msg_id;
  hdr.msg_size = rec.header.msg_size;
  hdr.txn_id = rec.header.txn_id;
  switch (rec.kind) {
    case sensor1_wire::kResponse:
      run_callback(h, &hdr, SENSOR1_MSG_TYPE_RESP, copy_body(rec));
      return;
    case sensor1_wire::kIndication:
      run_callback(h, &hdr, SENSOR1_MSG_TYPE_IND, copy_body(rec));
      return;
    case sensor1_wire::kRetryOpen:
      run_callback(h, &hdr, SENSOR1_MSG_TYPE_RETRY_OPEN, nullptr);
      return;
    case sensor1_wire::kCallback:
      run_callback(h, (rec.flags & sensor1_wire::kWithHeader) != 0 ? &hdr : nullptr, rec.value,
                   (rec.flags & sensor1_wire::kWithBody) != 0 ? copy_body(rec) : nullptr);
      return;
    case sensor1_wire::kFault:
      apply_fault(h, rec);
      return;
    default:
      return;  // a kind this library does not read is skipped
  }
}

// Delivers every complete record in h->rx, stopping as soon as the connection is closed (by a
// callback, or by another thread). False when the stream is malformed.
bool deliver_buffered(Connection* h) {
  size_t pos = 0;
  for (;;) {
    Record rec;
    const long span = sensor1_wire::parse(h->rx.data() + pos, h->rx.size() - pos, &rec);
    if (span < 0) {
      h->rx.clear();
      return false;
    }
    if (span == 0) break;
    if (!is_open(h)) {
      h->rx.clear();
      return true;
    }
    // The callback may open connections or close this one: the record is copied out first.
    const std::vector<uint8_t> copy(h->rx.begin() + static_cast<long>(pos),
                                    h->rx.begin() + static_cast<long>(pos) + span);
    pos += static_cast<size_t>(span);
    sensor1_wire::parse(copy.data(), copy.size(), &rec);
    deliver(h, rec);
  }
  h->rx.erase(h->rx.begin(), h->rx.begin() + static_cast<long>(pos));
  return true;
}

// Delivers the records that came ahead of an OPEN_RESULT, in arrival order per connection.
void deliver_early_records() {
  for (;;) {
    Connection* h = nullptr;
    std::vector<uint8_t> bytes;
    pthread_mutex_lock(&g_lock);
    for (Connection* c : g_connections) {
      if (!c->early.empty()) {
        h = c;
        bytes = std::move(c->early.front());
        c->early.pop_front();
        break;
      }
    }
    pthread_mutex_unlock(&g_lock);
    if (h == nullptr) return;
    Record rec;
    if (sensor1_wire::parse(bytes.data(), bytes.size(), &rec) == static_cast<long>(bytes.size())) {
      deliver(h, rec);
    }
  }
}

void close_retired_descriptors() {
  std::vector<Connection*> retired;
  pthread_mutex_lock(&g_lock);
  for (Connection* h : g_connections) {
    if (h->fd_to_close) {
      h->fd_to_close = false;
      retired.push_back(h);
    }
  }
  pthread_mutex_unlock(&g_lock);
  for (Connection* h : retired) {
    pthread_mutex_lock(&h->io_lock);
    if (h->fd >= 0) close(h->fd);
    h->fd = -1;
    pthread_mutex_unlock(&h->io_lock);
    // Only this thread touches rx; the memory of a long-gone connection is given back.
    std::vector<uint8_t>().swap(h->rx);
    pthread_mutex_lock(&g_lock);
    h->reusable = h->state == LinkState::kClosed;
    pthread_mutex_unlock(&g_lock);
  }
}

// The handle of h: slot + 1 in the low 16 bits, the generation above. Called with g_lock held.
sensor1_handle_s* handle_of(const Connection* h) {
  return reinterpret_cast<sensor1_handle_s*>(static_cast<uintptr_t>(h->generation) << 16 |
                                             (h->slot + 1));
}

// The connection of a handle still current, or null. Called with g_lock held.
Connection* connection_of(sensor1_handle_s* handle) {
  const uintptr_t v = reinterpret_cast<uintptr_t>(handle);
  const size_t slot = (v & 0xffff) - 1;
  if ((v & 0xffff) == 0 || slot >= g_connections.size()) return nullptr;
  Connection* h = g_connections[slot];
  return !h->reusable && h->generation == v >> 16 ? h : nullptr;
}

// The connection of a handle, looked up under g_lock; the caller checks again under g_lock that
// the handle is still current before it acts (a record never goes away, but it may be reused).
Connection* find_connection(sensor1_handle_s* handle) {
  pthread_mutex_lock(&g_lock);
  Connection* h = connection_of(handle);
  pthread_mutex_unlock(&g_lock);
  return h;
}

void* library_thread(void*) {
  t_library_thread = true;
  std::vector<pollfd> fds;
  std::vector<Connection*> polled;
  for (;;) {
    close_retired_descriptors();
    deliver_early_records();
    fds.clear();
    polled.clear();
    fds.push_back({g_wake[0], POLLIN, 0});
    pthread_mutex_lock(&g_lock);
    for (Connection* h : g_connections) {
      if (h->state != LinkState::kOpen) continue;
      // Only this thread closes descriptors, so h->fd is stable here without io_lock.
      fds.push_back({h->fd, POLLIN, 0});
      polled.push_back(h);
    }
    pthread_mutex_unlock(&g_lock);
    const int n = poll(fds.data(), fds.size(), -1);
    if (n < 0) continue;  // EINTR
    if (fds[0].revents != 0) {
      uint8_t drain[64];
      ssize_t ignored = read(g_wake[0], drain, sizeof drain);
      (void)ignored;
    }
    // Connections the callbacks below open are polled on the next pass.
    for (size_t i = 1; i < fds.size(); ++i) {
      if (fds[i].revents == 0) continue;
      Connection* h = polled[i - 1];
      if (!is_open(h)) continue;
      const int got = sensor1_wire::receive_available(fds[i].fd, &h->rx);
      if (got != 0 && (got < 0 || !deliver_buffered(h))) end_connection(h);
    }
  }
  return nullptr;
}

void start_library_thread() {
  if (pipe2(g_wake, O_CLOEXEC | O_NONBLOCK) != 0) return;
  pthread_t thread;
  if (pthread_create(&thread, nullptr, library_thread, nullptr) != 0) return;
  pthread_detach(thread);
  g_thread_started = true;
}

// A connection record for a new connection, of the socket or in process: a reusable one or a
// new one. Called with g_lock held.
Connection* claim_connection(sensor1_notify_data_cb_t cb, intptr_t cb_data, bool in_process) {
  Connection* h = nullptr;
  for (Connection* c : g_connections) {
    if (c->reusable && (c->link != nullptr) == in_process) {
      h = c;
      break;
    }
  }
  if (h == nullptr) {
    h = new Connection;
    h->slot = g_connections.size();
    if (in_process) h->link = new InProcessLink(h);
    g_connections.push_back(h);
  }
  // A reused record: closed, its descriptor closed, out of the thread's poll set, no callback.
  h->cb = cb;
  h->cb_data = cb_data;
  ++h->generation;
  h->reusable = false;
  h->state = LinkState::kOpen;
  h->fd_to_close = false;
  for (Fault& f : h->faults) f = Fault{};
  h->early.clear();
  return h;
}

// Delivers g_inbox on this thread, unless another thread is at it (it delivers what was queued
// here once its callback has returned). Within a callback, records sent meanwhile are delivered
// at once.
void deliver_inbox() {
  const bool outer = !t_delivering;
  bool idle = false;
  if (outer && !g_delivering.compare_exchange_strong(idle, true)) return;
  const bool was_library_thread = t_library_thread;
  t_delivering = true;
  t_library_thread = true;  // a close from inside the callback goes through
  for (;;) {
    Inbound next;
    {
      std::lock_guard<std::mutex> lock(g_inbox_mu);
      if (g_inbox.empty()) break;
      next = std::move(g_inbox.front());
      g_inbox.pop_front();
    }
    Connection* h = next.connection;
    pthread_mutex_lock(&g_lock);
    const bool current = h->generation == next.generation && !h->reusable;
    pthread_mutex_unlock(&g_lock);
    Record rec;
    if (!current) continue;
    if (next.record.empty() || sensor1_wire::parse(next.record.data(), next.record.size(), &rec) !=
                                   static_cast<long>(next.record.size())) {
      end_connection(h);
    } else if (is_open(h)) {
      deliver(h, rec);
    }
  }
  if (!outer) return;
  t_delivering = false;
  t_library_thread = was_library_thread;
  g_delivering.store(false);
  // A record queued while the flag was still set has nobody else to deliver it.
  bool more;
  {
    std::lock_guard<std::mutex> lock(g_inbox_mu);
    more = !g_inbox.empty();
  }
  if (more) deliver_inbox();
}

// Queues a record (or, empty, the end) of h's current connection. Called with g_inbox_mu held.
void queue_inbound(Connection* h, std::vector<uint8_t> record) {
  pthread_mutex_lock(&g_lock);
  const uint64_t generation = h->generation;
  pthread_mutex_unlock(&g_lock);
  g_inbox.push_back({h, generation, std::move(record)});
}

bool InProcessLink::send(const uint8_t* record, size_t size) {
  {
    std::lock_guard<std::mutex> lock(g_inbox_mu);
    if (ended) return false;
    Record rec;
    if (opening && !answered && sensor1_wire::parse(record, size, &rec) > 0 &&
        rec.kind == sensor1_wire::kOpenResult) {
      answered = true;
      open_result = rec.value;
      return true;
    }
    queue_inbound(connection, std::vector<uint8_t>(record, record + size));
    if (opening) return true;
  }
  deliver_inbox();
  return true;
}

void InProcessLink::drop() {
  {
    std::lock_guard<std::mutex> lock(g_inbox_mu);
    if (ended) return;
    ended = true;
    queue_inbound(connection, {});
    if (opening) return;
  }
  deliver_inbox();
}

// sensor1_open with the peer: the OPEN handshake within the peer's receive.
int open_in_process(sensor1_host::Peer* peer, sensor1_handle_s** handle,
                    sensor1_notify_data_cb_t cb, intptr_t cb_data) {
  pthread_mutex_lock(&g_lock);
  Connection* h = claim_connection(cb, cb_data, true);
  pthread_mutex_unlock(&g_lock);
  InProcessLink* link = h->link;
  {
    std::lock_guard<std::mutex> lock(g_inbox_mu);
    link->peer = peer;
    link->opening = true;
    link->answered = false;
    link->ended = false;
  }
  const std::vector<uint8_t> open = sensor1_wire::encode(sensor1_wire::plain(sensor1_wire::kOpen));
  peer->receive(link, open.data(), open.size());
  int32_t result;
  {
    std::lock_guard<std::mutex> lock(g_inbox_mu);
    link->opening = false;
    result = link->answered ? link->open_result : SENSOR1_EWOULDBLOCK;
    if (result != SENSOR1_SUCCESS) link->ended = true;
  }
  log_line("open -> %d", result);
  pthread_mutex_lock(&g_lock);
  if (result != SENSOR1_SUCCESS) {
    h->state = LinkState::kClosed;
    h->reusable = true;  // what it had queued is of a generation gone
  } else {
    *handle = handle_of(h);
  }
  pthread_mutex_unlock(&g_lock);
  if (result != SENSOR1_SUCCESS) return result;
  deliver_inbox();
  return SENSOR1_SUCCESS;
}

}  // namespace

extern "C" {

int sensor1_init(void) {
  return host_environment().sensor1_init_result;
}

int sensor1_open(sensor1_handle_s** handle, sensor1_notify_data_cb_t cb, intptr_t cb_data) {
  if (handle == nullptr || cb == nullptr) {
    log_line("open -> %d", SENSOR1_HOST_EINVAL);
    return SENSOR1_HOST_EINVAL;
  }
  sensor1_host::Peer* peer = g_peer.load();
  if (peer != nullptr) return open_in_process(peer, handle, cb, cb_data);
  pthread_once(&g_thread_once, start_library_thread);
  if (!g_thread_started) {
    log_line("open -> %d", SENSOR1_HOST_EPIPE);
    return SENSOR1_HOST_EPIPE;
  }
  pthread_mutex_lock(&g_lock);
  Connection* h = claim_connection(cb, cb_data, false);
  h->state = LinkState::kOpening;  // out of the poll set; its early records are delivered
  pthread_mutex_unlock(&g_lock);
  int32_t result = 0;
  const int fd =
      sensor1_wire::connect_and_open(host_environment().sensor1_socket, kHandshakeTimeoutSeconds,
                                     &result, [h](std::vector<uint8_t> record) {
                                       pthread_mutex_lock(&g_lock);
                                       h->early.push_back(std::move(record));
                                       pthread_mutex_unlock(&g_lock);
                                       wake_thread();
                                     });
  pthread_mutex_lock(&g_lock);
  if (fd < 0) {
    // No handle was given out; the thread makes the record reusable on its next pass.
    h->state = LinkState::kClosed;
    h->early.clear();
    h->fd_to_close = true;
  } else {
    // Without its io_lock (taken before g_lock): a late caller checks the handle under g_lock
    // before it touches the descriptor.
    h->fd = fd;
    h->state = LinkState::kOpen;
    *handle = handle_of(h);
  }
  pthread_mutex_unlock(&g_lock);
  wake_thread();
  log_line("open -> %d", fd < 0 ? result : SENSOR1_SUCCESS);
  return fd < 0 ? result : SENSOR1_SUCCESS;
}

int sensor1_close(sensor1_handle_s* handle) {
  Connection* h = find_connection(handle);
  if (h == nullptr) {
    count_stale("close", handle);
    log_line("close -> %d", SENSOR1_HOST_EINVAL);
    return SENSOR1_HOST_EINVAL;
  }
  pthread_mutex_lock(&h->io_lock);
  pthread_mutex_lock(&g_lock);
  int result = SENSOR1_SUCCESS;
  bool closed_now = false;
  const bool stale = connection_of(handle) != h || h->state == LinkState::kClosed ||
                     h->state == LinkState::kOpening;
  if (stale) {
    result = SENSOR1_HOST_EINVAL;
  } else {
    take_fault(h, FaultOp::kClose, &result);
    h->fd_to_close = true;
    h->state = LinkState::kClosed;
    closed_now = true;
    // The simulator sees the end at once; the descriptor itself is closed by the thread.
    if (h->fd >= 0) shutdown(h->fd, SHUT_RDWR);
  }
  pthread_mutex_unlock(&h->io_lock);
  // No new callback starts on a closed connection; one already running is waited for, unless
  // this is that callback's own thread.
  const bool waits = closed_now && h->in_callback && !t_library_thread;
  if (waits) {
    pthread_mutex_unlock(&g_lock);
    __android_log_print(ANDROID_LOG_INFO, kTag, "close waits for a callback");
    pthread_mutex_lock(&g_lock);
  }
  while (waits && h->in_callback) pthread_cond_wait(&g_callback_returned, &g_lock);
  pthread_mutex_unlock(&g_lock);
  if (stale) count_stale("close", handle);
  bool tell_peer = false;
  if (closed_now && h->link != nullptr) {
    {
      std::lock_guard<std::mutex> lock(g_inbox_mu);  // taken before g_lock, never after
      tell_peer = !h->link->ended;
      h->link->ended = true;
    }
    // In process there is no descriptor: the record may be used again at once.
    pthread_mutex_lock(&g_lock);
    h->reusable = true;
    pthread_mutex_unlock(&g_lock);
  }
  if (closed_now && h->link == nullptr) wake_thread();
  if (tell_peer) h->link->peer->closed(h->link);
  log_line("close -> %d", result);
  return result;
}

int sensor1_alloc_msg_buf(sensor1_handle_s* handle, uint16_t size, void** buf) {
  if (buf == nullptr) return SENSOR1_HOST_EINVAL;
  *buf = nullptr;
  pthread_mutex_lock(&g_lock);
  Connection* h = connection_of(handle);
  int result = SENSOR1_SUCCESS;
  const bool stale =
      h == nullptr || h->state == LinkState::kClosed || h->state == LinkState::kOpening;
  if (stale) {
    result = SENSOR1_HOST_EINVAL;
  } else if (h->state == LinkState::kEnded) {
    result = SENSOR1_HOST_EPIPE;
  } else {
    take_fault(h, FaultOp::kAlloc, &result);
  }
  pthread_mutex_unlock(&g_lock);
  if (stale) count_stale("alloc", handle);
  if (result != SENSOR1_SUCCESS) return result;
  *buf = alloc_body(size);
  return *buf != nullptr ? SENSOR1_SUCCESS : ENOMEM;
}

int sensor1_free_msg_buf(sensor1_handle_s* handle, void* buf) {
  // An empty handle will do: after a broken link the daemon frees bodies with whatever handle is
  // current. A closed one is counted; the body is released all the same.
  pthread_mutex_lock(&g_lock);
  const Connection* h = connection_of(handle);
  const bool stale =
      h == nullptr || h->state == LinkState::kClosed || h->state == LinkState::kOpening;
  pthread_mutex_unlock(&g_lock);
  if (stale) count_stale("free", handle);
  release_body(buf);
  return SENSOR1_SUCCESS;
}

int sensor1_write(sensor1_handle_s* handle, sensor1_msg_header_s* hdr, void* body) {
  if (hdr == nullptr) return SENSOR1_HOST_EINVAL;
  if (body == nullptr && hdr->msg_size != 0) return SENSOR1_HOST_EINVAL;
  Connection* h = find_connection(handle);
  if (h == nullptr) {
    count_stale("write", handle);
    return SENSOR1_HOST_EINVAL;
  }
  const std::vector<uint8_t> rec = sensor1_wire::encode(sensor1_wire::message(
      sensor1_wire::kWrite, {hdr->service_number, hdr->msg_id, 0, hdr->txn_id},
      static_cast<const uint8_t*>(body), hdr->msg_size));

  pthread_mutex_lock(&h->io_lock);
  pthread_mutex_lock(&g_lock);
  int result = SENSOR1_SUCCESS;
  bool faulted = false;
  const bool stale = connection_of(handle) != h || h->state == LinkState::kClosed ||
                     h->state == LinkState::kOpening;
  if (stale) {
    result = SENSOR1_HOST_EINVAL;
  } else if (h->state == LinkState::kEnded) {
    result = SENSOR1_HOST_EPIPE;
  } else {
    faulted = take_fault(h, FaultOp::kWrite, &result);
  }
  pthread_mutex_unlock(&g_lock);
  if (stale) count_stale("write", handle);
  // A write faulted with EWOULDBLOCK still goes out and takes the body, like a success.
  const bool send = result == SENSOR1_SUCCESS || (faulted && result == SENSOR1_EWOULDBLOCK);
  if (send && h->link != nullptr
          ? !link_open(h)
          : send && !(h->fd >= 0 && sensor1_wire::send_all(h->fd, rec.data(), rec.size()))) {
    result = SENSOR1_HOST_EPIPE;
  }
  pthread_mutex_unlock(&h->io_lock);
  const bool taken = result == SENSOR1_SUCCESS || (faulted && result == SENSOR1_EWOULDBLOCK);
  if (taken) release_body(body);
  // In process the peer answers now, on this thread, with no lock of the library held.
  if (taken && h->link != nullptr) send_in_process(h, rec);
  return result;
}

void* sensor1_host_alloc_body(size_t size) {
  return alloc_body(size);
}

long sensor1_host_outstanding_bodies(void) {
  return g_outstanding.load();
}

long sensor1_host_stale_handle_calls(void) {
  return g_stale_calls.load();
}

}  // extern "C"

void sensor1_host::use_in_process_peer(Peer* peer) {
  g_peer.store(peer);
}
