// SPDX-License-Identifier: Apache-2.0
#include "sensor1_wire.h"

#include <errno.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

#include "byte_order.h"

namespace sensor1_wire {

namespace {

constexpr int32_t kNotUp = 11;  // EWOULDBLOCK: the service is not up

// Bytes of the fields before HDR, for the kinds that carry one; -1 for the others.
int fields_before_hdr(uint8_t kind) {
  switch (kind) {
    case kWrite:
    case kResponse:
    case kIndication:
      return 0;
    case kCallback:
      return 5;
    default:
      return -1;
  }
}

// Bytes of the fields of the kinds without HDR; -1 for a kind not listed.
long fixed_fields(uint8_t kind) {
  switch (kind) {
    case kOpen:
    case kRetryOpen:
      return 0;
    case kFaultAck:
      return 1;
    case kOpenResult:
      return 4;
    case kFault:
      return 9;
    default:
      return -1;
  }
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

}  // namespace

Record plain(Kind kind) {
  Record r;
  r.kind = kind;
  return r;
}

Record message(Kind kind, Header header, const uint8_t* body, size_t size) {
  Record r = plain(kind);
  r.header = header;
  r.header.msg_size = static_cast<uint16_t>(size < kMaxBody ? size : kMaxBody);
  r.body = body;
  return r;
}

Record result(Kind kind, int32_t value) {
  Record r = plain(kind);
  r.value = value;
  return r;
}

void append(const Record& rec, std::vector<uint8_t>* out) {
  const size_t start = out->size();
  const int before_hdr = fields_before_hdr(rec.kind);
  const long fixed = fixed_fields(rec.kind);
  const size_t fields = before_hdr >= 0 ? before_hdr + kHdrSize + rec.header.msg_size
                                        : static_cast<size_t>(fixed > 0 ? fixed : 0);
  out->resize(start + kLengthSize + 1 + fields, 0);
  uint8_t* p = out->data() + start;
  store_u32(p, 0, static_cast<uint32_t>(1 + fields));
  p[kLengthSize] = rec.kind;
  uint8_t* f = p + kLengthSize + 1;
  switch (rec.kind) {
    case kFaultAck:
      f[0] = rec.op;
      return;
    case kOpenResult:
      store_i32(f, 0, rec.value);
      return;
    case kFault:
      f[0] = rec.op;
      store_i32(f, 1, rec.value);
      store_u32(f, 5, rec.count);
      return;
    case kCallback:
      store_i32(f, 0, rec.value);
      f[4] = rec.flags;
      f += 5;
      break;
    default:
      if (before_hdr < 0) return;
      break;
  }
  store_u32(f, 0, rec.header.service);
  store_i32(f, 4, rec.header.msg_id);
  store_u16(f, 8, rec.header.msg_size);
  f[10] = rec.header.txn_id;
  if (rec.header.msg_size > 0) memcpy(f + kHdrSize, rec.body, rec.header.msg_size);
}

std::vector<uint8_t> encode(const Record& record) {
  std::vector<uint8_t> out;
  append(record, &out);
  return out;
}

long parse(const uint8_t* data, size_t size, Record* rec) {
  if (size < kLengthSize) return 0;
  const uint32_t len = load_u32(data, 0);
  if (len == 0 || len > kMaxRecord) return -1;
  if (size - kLengthSize < len) return 0;
  const long span = static_cast<long>(kLengthSize + len);
  *rec = Record();
  rec->kind = data[kLengthSize];
  const uint8_t* f = data + kLengthSize + 1;
  const size_t avail = len - 1;
  const int before_hdr = fields_before_hdr(rec->kind);
  if (before_hdr < 0) {
    const long fixed = fixed_fields(rec->kind);
    if (fixed < 0) return span;  // a kind this side does not know: skipped
    if (avail != static_cast<size_t>(fixed)) return -1;
    if (rec->kind == kOpenResult) {
      rec->value = load_i32(f, 0);
    } else if (fixed > 0) {
      rec->op = f[0];
    }
    if (rec->kind == kFault) {
      rec->value = load_i32(f, 1);
      rec->count = load_u32(f, 5);
    }
    return span;
  }
  if (avail < static_cast<size_t>(before_hdr) + kHdrSize) return -1;
  if (rec->kind == kCallback) {
    rec->value = load_i32(f, 0);
    rec->flags = f[4];
  }
  f += before_hdr;
  rec->header.service = load_u32(f, 0);
  rec->header.msg_id = load_i32(f, 4);
  rec->header.msg_size = load_u16(f, 8);
  rec->header.txn_id = f[10];
  if (f[11] != 0 || avail != static_cast<size_t>(before_hdr) + kHdrSize + rec->header.msg_size) {
    return -1;
  }
  rec->body = f + kHdrSize;
  return span;
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

int receive_available(int fd, std::vector<uint8_t>* rx) {
  constexpr size_t kChunk = 64 * 1024;
  const size_t had = rx->size();
  rx->resize(had + kChunk);
  ssize_t got;
  do {
    got = recv(fd, rx->data() + had, kChunk, MSG_DONTWAIT);
  } while (got < 0 && errno == EINTR);
  rx->resize(had + (got > 0 ? static_cast<size_t>(got) : 0));
  if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) return 0;
  return got > 0 ? 1 : -1;
}

int connect_and_open(const char* path, int timeout_seconds, int32_t* result,
                     const std::function<void(std::vector<uint8_t>)>& early) {
  *result = kNotUp;
  sockaddr_un addr;
  memset(&addr, 0, sizeof addr);
  addr.sun_family = AF_UNIX;
  if (strlen(path) >= sizeof addr.sun_path) return -1;
  memcpy(addr.sun_path, path, strlen(path));
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  // A simulator that accepted but never answers must not hang the caller.
  timeval tv = {timeout_seconds, 0};
  const std::vector<uint8_t> open = encode(plain(kOpen));
  bool answered = false;
  if (connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) == 0 &&
      setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv) == 0 &&
      send_all(fd, open.data(), open.size())) {
    // One record at a time, so nothing behind OPEN_RESULT is taken from the socket.
    for (;;) {
      std::vector<uint8_t> bytes(kLengthSize);
      if (!recv_exact(fd, bytes.data(), kLengthSize)) break;
      const uint32_t length = load_u32(bytes.data(), 0);
      if (length == 0 || length > kMaxRecord) break;
      bytes.resize(kLengthSize + length);
      Record rec;
      if (!recv_exact(fd, bytes.data() + kLengthSize, length) ||
          parse(bytes.data(), bytes.size(), &rec) != static_cast<long>(bytes.size())) {
        break;
      }
      if (rec.kind == kOpenResult) {
        *result = rec.value;
        answered = true;
        break;
      }
      if (!early) break;
      early(std::move(bytes));
    }
  }
  tv = {0, 0};
  if (!answered || *result != 0 || setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv) != 0) {
    if (!answered) *result = kNotUp;
    close(fd);
    return -1;
  }
  return fd;
}

}  // namespace sensor1_wire
