// The sensor1 client library of the host build. Each connection is a Unix stream socket to
// kestrel-sim at KESTREL_SENSOR1_SOCKET. Both directions carry records:
//
//   u32 length (bytes that follow) | u8 kind | fields of the kind
//
// with a message header HDR = u32 service, i32 msg_id, u16 msg_size, u8 txn_id, u8 0, followed
// by msg_size body bytes. The library writes OPEN, WRITE and FAULT_ACK; the simulator writes
// OPEN_RESULT, RESPONSE, INDICATION, RETRY_OPEN, FAULT and CALLBACK.
//
// One library thread, started by the first successful open, polls every open connection and
// calls each connection's callback, one message at a time, in arrival order. No library lock is
// held while a callback runs, so a callback may block, open a new connection or close any
// connection, its own included.
//
// Like a phone's client library, sensor1_close does not return while a callback is running on
// the connection it closes: it waits for that callback to return. A close on the library's own
// thread (from inside a callback) goes through at once.
//
// Handles are never freed: a closed handle stays in the process-wide list, marked closed, so a
// late call on it gets an error instead of touching freed memory. The file descriptor of a
// connection is closed only by the library thread (or by the failed open that created it), never
// while it may sit in the thread's poll set.
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
#include <vector>

#include "host_env.h"
#include "sensor1_host.h"

namespace {

constexpr char kTag[] = "libsensor1";

// Record kinds.
constexpr uint8_t kRecOpen = 1;
constexpr uint8_t kRecWrite = 2;
constexpr uint8_t kRecFaultAck = 3;
constexpr uint8_t kRecOpenResult = 64;
constexpr uint8_t kRecResponse = 65;
constexpr uint8_t kRecIndication = 66;
constexpr uint8_t kRecRetryOpen = 67;
constexpr uint8_t kRecFault = 68;
constexpr uint8_t kRecCallback = 69;

constexpr size_t kHdrSize = 12;
// Largest record accepted from the simulator: a full 16-bit body, its header and a few fields.
constexpr uint32_t kMaxRecord = 65535 + kHdrSize + 16;
// How long an open waits for OPEN_RESULT before it gives up with 11.
constexpr time_t kHandshakeTimeoutSeconds = 10;

// Fault operations, as numbered on the wire.
constexpr uint8_t kOpAlloc = 1;
constexpr uint8_t kOpWrite = 2;
constexpr uint8_t kOpClose = 3;
constexpr int kOpCount = 3;

uint32_t get_u32(const uint8_t* p) {
  uint32_t v;
  memcpy(&v, p, sizeof v);
  return v;
}
int32_t get_i32(const uint8_t* p) {
  int32_t v;
  memcpy(&v, p, sizeof v);
  return v;
}
uint16_t get_u16(const uint8_t* p) {
  uint16_t v;
  memcpy(&v, p, sizeof v);
  return v;
}
void put_u32(uint8_t* p, uint32_t v) {
  memcpy(p, &v, sizeof v);
}
void put_i32(uint8_t* p, int32_t v) {
  memcpy(p, &v, sizeof v);
}
void put_u16(uint8_t* p, uint16_t v) {
  memcpy(p, &v, sizeof v);
}

enum class LinkState { kOpen, kEnded, kClosed };

struct Fault {
  int result = 0;
  uint32_t count = 0;
};

}  // namespace

struct sensor1_handle_s {
  sensor1_notify_data_cb_t cb = nullptr;
  intptr_t cb_data = 0;
  sensor1_handle_s* next = nullptr;  // process-wide list, never unlinked

  // Guarded by io_lock: the descriptor (-1 once closed) and every write to it, so records of
  // different threads never interleave and the descriptor is never closed under a writer.
  pthread_mutex_t io_lock = PTHREAD_MUTEX_INITIALIZER;
  int fd = -1;

  // Guarded by g_lock.
  LinkState state = LinkState::kOpen;
  bool in_callback = false;  // the library thread is inside this connection's callback
  bool fd_to_close = false;  // closed or ended, descriptor still to be closed by the thread
  Fault faults[kOpCount];

  // Library thread only: bytes received and not yet delivered.
  std::vector<uint8_t> rx;
};

namespace {

// Lock order: a handle's io_lock before g_lock.
pthread_mutex_t g_lock = PTHREAD_MUTEX_INITIALIZER;
pthread_cond_t g_callback_returned = PTHREAD_COND_INITIALIZER;  // with g_lock
thread_local bool t_library_thread = false;
sensor1_handle_s* g_handles = nullptr;  // guarded by g_lock
pthread_once_t g_thread_once = PTHREAD_ONCE_INIT;
int g_wake[2] = {-1, -1};  // pipe that wakes the library thread when the set changes
bool g_thread_started = false;
std::atomic<long> g_outstanding{0};

void log_line(const char* fmt, int value) {
  __android_log_print(ANDROID_LOG_INFO, kTag, fmt, value);
}

void* alloc_body(size_t size) {
  void* p = calloc(1, size > 0 ? size : 1);
  if (p != nullptr) g_outstanding.fetch_add(1);
  return p;
}

void release_body(void* body) {
  if (body == nullptr) return;
  free(body);
  g_outstanding.fetch_sub(1);
}

bool send_all(int fd, const uint8_t* data, size_t size) {
  while (size > 0) {
    const ssize_t n = send(fd, data, size, MSG_NOSIGNAL);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

bool recv_exact(int fd, uint8_t* data, size_t size) {
  while (size > 0) {
    const ssize_t n = recv(fd, data, size, 0);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

void wake_thread() {
  const uint8_t b = 1;
  ssize_t ignored = write(g_wake[1], &b, 1);
  (void)ignored;
}

// Consumes one fault of op on h, if one is armed. Called with g_lock held.
bool take_fault(sensor1_handle_s* h, uint8_t op, int* result) {
  Fault& f = h->faults[op - 1];
  if (f.count == 0) return false;
  --f.count;
  *result = f.result;
  return true;
}

const char* op_name(uint8_t op) {
  switch (op) {
    case kOpAlloc:
      return "alloc";
    case kOpWrite:
      return "write";
    case kOpClose:
      return "close";
    default:
      return "unknown";
  }
}

// Runs h's callback on the library thread; a close of h waits until it has returned.
void run_callback(sensor1_handle_s* h, sensor1_msg_header_s* hdr, int type, void* body) {
  pthread_mutex_lock(&g_lock);
  h->in_callback = true;
  pthread_mutex_unlock(&g_lock);
  h->cb(h->cb_data, hdr, type, body);
  pthread_mutex_lock(&g_lock);
  h->in_callback = false;
  pthread_cond_broadcast(&g_callback_returned);
  pthread_mutex_unlock(&g_lock);
}

// Sends one record on h under its io_lock. False when the connection is gone.
bool send_record(sensor1_handle_s* h, const uint8_t* data, size_t size) {
  pthread_mutex_lock(&h->io_lock);
  const bool ok = h->fd >= 0 && send_all(h->fd, data, size);
  pthread_mutex_unlock(&h->io_lock);
  return ok;
}

// The connection ended without sensor1_close: it is dead from now on and its callback hears of
// it once.
void end_connection(sensor1_handle_s* h) {
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

bool is_open(sensor1_handle_s* h) {
  pthread_mutex_lock(&g_lock);
  const bool open = h->state == LinkState::kOpen;
  pthread_mutex_unlock(&g_lock);
  return open;
}

// Reads HDR at p (kHdrSize bytes) and the body after it (at most avail bytes) into hdr and a
// body of the library's allocator. False when the record is too short for the size it claims.
bool take_message(const uint8_t* p, size_t avail, sensor1_msg_header_s* hdr, void** body) {
  if (avail < kHdrSize) return false;
  memset(hdr, 0, sizeof *hdr);
  hdr->service_number = get_u32(p);
  hdr->msg_id = get_i32(p + 4);
  hdr->msg_size = get_u16(p + 8);
  hdr->txn_id = p[10];
  if (avail - kHdrSize < hdr->msg_size) return false;
  *body = alloc_body(hdr->msg_size);
  if (*body != nullptr && hdr->msg_size > 0) memcpy(*body, p + kHdrSize, hdr->msg_size);
  return true;
}

void apply_fault(sensor1_handle_s* h, const uint8_t* p, size_t avail) {
  if (avail < 9) return;
  const uint8_t op = p[0];
  const int32_t result = get_i32(p + 1);
  const uint32_t count = get_u32(p + 5);
  if (op >= kOpAlloc && op <= kOpClose) {
    pthread_mutex_lock(&g_lock);
    h->faults[op - 1].result = result;
    h->faults[op - 1].count = count;
    pthread_mutex_unlock(&g_lock);
    __android_log_print(ANDROID_LOG_INFO, kTag, "fault %s -> %d count %u", op_name(op), result,
                        count);
  }
  uint8_t ack[6];
  put_u32(ack, 2);
  ack[4] = kRecFaultAck;
  ack[5] = op;
  send_record(h, ack, sizeof ack);
}

// Handles one record (kind and fields in p, size bytes). False on a malformed record.
bool deliver(sensor1_handle_s* h, const uint8_t* p, size_t size) {
  const uint8_t kind = p[0];
  const uint8_t* f = p + 1;
  const size_t avail = size - 1;
  sensor1_msg_header_s hdr;
  memset(&hdr, 0, sizeof hdr);
  void* body = nullptr;
  switch (kind) {
    case kRecResponse:
    case kRecIndication:
      if (!take_message(f, avail, &hdr, &body)) return false;
      run_callback(h, &hdr, kind == kRecResponse ? SENSOR1_MSG_TYPE_RESP : SENSOR1_MSG_TYPE_IND,
                   body);
      return true;
    case kRecRetryOpen:
      run_callback(h, &hdr, SENSOR1_MSG_TYPE_RETRY_OPEN, nullptr);
      return true;
    case kRecCallback: {
      if (avail < 5) return false;
      const int32_t type = get_i32(f);
      const uint8_t flags = f[4];
      if (!take_message(f + 5, avail - 5, &hdr, &body)) return false;
      if ((flags & 2) == 0) {
        release_body(body);
        body = nullptr;
      }
      run_callback(h, (flags & 1) != 0 ? &hdr : nullptr, type, body);
      return true;
    }
    case kRecFault:
      apply_fault(h, f, avail);
      return true;
    default:
      return true;  // a kind this library does not know is skipped
  }
}

// Delivers every complete record in h->rx, stopping as soon as the connection is closed (by a
// callback, or by another thread). False when the stream is malformed.
bool deliver_buffered(sensor1_handle_s* h) {
  size_t pos = 0;
  bool ok = true;
  while (h->rx.size() - pos >= 4) {
    const uint32_t len = get_u32(h->rx.data() + pos);
    if (len == 0 || len > kMaxRecord) {
      ok = false;
      break;
    }
    if (h->rx.size() - pos - 4 < len) break;
    if (!is_open(h)) {
      h->rx.clear();
      return true;
    }
    // The callback may open connections or close this one; the record is copied out first.
    std::vector<uint8_t> record(h->rx.begin() + static_cast<long>(pos) + 4,
                                h->rx.begin() + static_cast<long>(pos) + 4 + len);
    pos += 4 + len;
    if (!deliver(h, record.data(), record.size())) {
      ok = false;
      break;
    }
  }
  if (!ok) {
    h->rx.clear();
    return false;
  }
  h->rx.erase(h->rx.begin(), h->rx.begin() + static_cast<long>(pos));
  return true;
}

void close_retired_descriptors() {
  std::vector<sensor1_handle_s*> retired;
  pthread_mutex_lock(&g_lock);
  for (sensor1_handle_s* h = g_handles; h != nullptr; h = h->next) {
    if (h->fd_to_close) {
      h->fd_to_close = false;
      retired.push_back(h);
    }
  }
  pthread_mutex_unlock(&g_lock);
  for (sensor1_handle_s* h : retired) {
    pthread_mutex_lock(&h->io_lock);
    if (h->fd >= 0) close(h->fd);
    h->fd = -1;
    pthread_mutex_unlock(&h->io_lock);
  }
}

void* library_thread(void*) {
  t_library_thread = true;
  std::vector<pollfd> fds;
  std::vector<sensor1_handle_s*> polled;
  std::vector<uint8_t> chunk(64 * 1024);
  for (;;) {
    close_retired_descriptors();
    fds.clear();
    polled.clear();
    fds.push_back({g_wake[0], POLLIN, 0});
    pthread_mutex_lock(&g_lock);
    for (sensor1_handle_s* h = g_handles; h != nullptr; h = h->next) {
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
      sensor1_handle_s* h = polled[i - 1];
      if (!is_open(h)) continue;
      ssize_t got;
      do {
        got = recv(fds[i].fd, chunk.data(), chunk.size(), MSG_DONTWAIT);
      } while (got < 0 && errno == EINTR);
      if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) continue;
      if (got <= 0) {
        end_connection(h);
        continue;
      }
      h->rx.insert(h->rx.end(), chunk.begin(), chunk.begin() + got);
      if (!deliver_buffered(h)) end_connection(h);
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

// Connects to the simulator and does the OPEN handshake. Returns the descriptor, or -1 with
// *result set.
int connect_and_handshake(int* result) {
  *result = SENSOR1_EWOULDBLOCK;
  const char* path = host_environment().sensor1_socket;
  sockaddr_un addr;
  memset(&addr, 0, sizeof addr);
  addr.sun_family = AF_UNIX;
  if (strlen(path) >= sizeof addr.sun_path) return -1;
  strcpy(addr.sun_path, path);
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  if (connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0) {
    close(fd);
    return -1;
  }
  // A simulator that accepted but never answers must not hang the caller.
  timeval tv = {kHandshakeTimeoutSeconds, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  uint8_t open_rec[5];
  put_u32(open_rec, 1);
  open_rec[4] = kRecOpen;
  // Exactly the OPEN_RESULT record is read here; whatever follows it belongs to the thread.
  uint8_t answer[9];
  if (!send_all(fd, open_rec, sizeof open_rec) || !recv_exact(fd, answer, sizeof answer) ||
      get_u32(answer) != 5 || answer[4] != kRecOpenResult) {
    close(fd);
    return -1;
  }
  *result = get_i32(answer + 5);
  if (*result != SENSOR1_SUCCESS) {
    close(fd);
    return -1;
  }
  tv = {0, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  return fd;
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
  int result = 0;
  const int fd = connect_and_handshake(&result);
  if (fd < 0) {
    log_line("open -> %d", result);
    return result;
  }
  pthread_once(&g_thread_once, start_library_thread);
  if (!g_thread_started) {
    close(fd);
    log_line("open -> %d", SENSOR1_HOST_EPIPE);
    return SENSOR1_HOST_EPIPE;
  }
  sensor1_handle_s* h = new sensor1_handle_s;
  h->cb = cb;
  h->cb_data = cb_data;
  h->fd = fd;
  *handle = h;
  log_line("open -> %d", SENSOR1_SUCCESS);
  pthread_mutex_lock(&g_lock);
  h->next = g_handles;
  g_handles = h;
  pthread_mutex_unlock(&g_lock);
  wake_thread();
  return SENSOR1_SUCCESS;
}

int sensor1_close(sensor1_handle_s* handle) {
  if (handle == nullptr) {
    log_line("close -> %d", SENSOR1_HOST_EINVAL);
    return SENSOR1_HOST_EINVAL;
  }
  pthread_mutex_lock(&handle->io_lock);
  pthread_mutex_lock(&g_lock);
  int result = SENSOR1_SUCCESS;
  bool closed_now = false;
  if (handle->state == LinkState::kClosed) {
    result = SENSOR1_HOST_EINVAL;
  } else {
    take_fault(handle, kOpClose, &result);
    handle->fd_to_close = true;
    handle->state = LinkState::kClosed;
    closed_now = true;
    // The simulator sees the end at once; the descriptor itself is closed by the thread.
    if (handle->fd >= 0) shutdown(handle->fd, SHUT_RDWR);
  }
  pthread_mutex_unlock(&handle->io_lock);
  // No new callback starts on a closed connection; one already running is waited for, unless
  // this is that callback's own thread.
  while (handle->in_callback && !t_library_thread) {
    pthread_cond_wait(&g_callback_returned, &g_lock);
  }
  pthread_mutex_unlock(&g_lock);
  if (closed_now) wake_thread();
  log_line("close -> %d", result);
  return result;
}

int sensor1_alloc_msg_buf(sensor1_handle_s* handle, uint16_t size, void** buf) {
  if (buf == nullptr) return SENSOR1_HOST_EINVAL;
  *buf = nullptr;
  if (handle == nullptr) return SENSOR1_HOST_EINVAL;
  pthread_mutex_lock(&g_lock);
  int result = SENSOR1_SUCCESS;
  if (handle->state == LinkState::kClosed) {
    result = SENSOR1_HOST_EINVAL;
  } else if (handle->state == LinkState::kEnded) {
    result = SENSOR1_HOST_EPIPE;
  } else {
    take_fault(handle, kOpAlloc, &result);
  }
  pthread_mutex_unlock(&g_lock);
  if (result != SENSOR1_SUCCESS) return result;
  *buf = alloc_body(size);
  return *buf != nullptr ? SENSOR1_SUCCESS : ENOMEM;
}

int sensor1_free_msg_buf(sensor1_handle_s*, void* buf) {
  // Any handle will do, null and closed ones included: after a broken link the daemon frees
  // bodies with whatever handle is current.
  release_body(buf);
  return SENSOR1_SUCCESS;
}

int sensor1_write(sensor1_handle_s* handle, sensor1_msg_header_s* hdr, void* body) {
  if (handle == nullptr || hdr == nullptr) return SENSOR1_HOST_EINVAL;
  if (body == nullptr && hdr->msg_size != 0) return SENSOR1_HOST_EINVAL;
  std::vector<uint8_t> rec(4 + 1 + kHdrSize + hdr->msg_size, 0);
  put_u32(rec.data(), static_cast<uint32_t>(rec.size() - 4));
  rec[4] = kRecWrite;
  put_u32(&rec[5], hdr->service_number);
  put_i32(&rec[9], hdr->msg_id);
  put_u16(&rec[13], hdr->msg_size);
  rec[15] = hdr->txn_id;
  if (hdr->msg_size > 0) memcpy(&rec[17], body, hdr->msg_size);

  pthread_mutex_lock(&handle->io_lock);
  pthread_mutex_lock(&g_lock);
  int result = SENSOR1_SUCCESS;
  bool faulted = false;
  if (handle->state == LinkState::kClosed) {
    result = SENSOR1_HOST_EINVAL;
  } else if (handle->state == LinkState::kEnded) {
    result = SENSOR1_HOST_EPIPE;
  } else {
    faulted = take_fault(handle, kOpWrite, &result);
  }
  pthread_mutex_unlock(&g_lock);
  // A write faulted with EWOULDBLOCK still goes out and takes the body, like a success.
  const bool send = result == SENSOR1_SUCCESS || (faulted && result == SENSOR1_EWOULDBLOCK);
  if (send && !(handle->fd >= 0 && send_all(handle->fd, rec.data(), rec.size()))) {
    result = SENSOR1_HOST_EPIPE;
  }
  pthread_mutex_unlock(&handle->io_lock);
  if (result == SENSOR1_SUCCESS || (faulted && result == SENSOR1_EWOULDBLOCK)) {
    release_body(body);
  }
  return result;
}

void* sensor1_host_alloc_body(size_t size) {
  return alloc_body(size);
}

long sensor1_host_outstanding_bodies(void) {
  return g_outstanding.load();
}

}  // extern "C"
