// SPDX-License-Identifier: Apache-2.0
// Sensors registry stand-in: the items of the KESTREL_SENSOR_REG text file, read anew at every
// sensor_reg_open. One line each:
//
//   # comment                 ('#' also ends a line early)
//   406 = 01 02 03 04         item 406 and its bytes in hex; "406 =" is an item of no bytes
//   open_failures = 2         the next 2 opens of this version of the file return -1
//   read_error 119 = 5        reading item 119 returns 5, with length 0 and no buffer
//   close_result = 7          every close returns 7
//
// Item ids are decimal 0..65535, results decimal 32-bit. A byte is a token of one or two hex
// digits; a longer even-length token ("01020304") is read as successive bytes. A line that
// does not fit one of these forms, an item of more than 255 bytes (the largest length the read
// can report) included, is ignored as a whole. When a name appears on several lines the last
// one counts. Only the first 4 MiB of the file are read.
//
// Failed opens are counted per version of the file: a version is the file's device, inode,
// size, modification time and a hash of its content, so a test that rewrites the file (even
// with the same text, as long as the modification time moves) starts the count again. A missing
// file is an empty registry with no failures.
//
// Items are served only while the registry is open: from a successful open to the next close.
// A read before that, or after a failed open, returns -1 with length 0.
#include <fcntl.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <android/log.h>

#include <map>
#include <string>
#include <vector>

#include "host_env.h"
#include "sensor_reg.h"
#include "sensor_reg_host.h"

namespace {

constexpr const char* kTag = "libsensor_reg";
constexpr size_t kMaxItemLength = 255;
constexpr size_t kMaxFileBytes = 4u << 20;

struct registry_contents {
  std::map<uint16_t, std::vector<uint8_t>> items;
  std::map<uint16_t, int> read_errors;
  int open_failures = 0;
  int close_result = 0;
};

// Which version of the file the failure count belongs to.
struct file_version {
  bool exists = false;
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  struct timespec mtime = {0, 0};
  uint64_t hash = 0;

  bool same_as(const file_version& o) const {
    return exists == o.exists && device == o.device && inode == o.inode && size == o.size &&
           mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec && hash == o.hash;
  }
};

pthread_mutex_t g_lock = PTHREAD_MUTEX_INITIALIZER;
registry_contents g_contents;  // as read by the latest open
bool g_open = false;
file_version g_counted_version;
int g_failures_used = 0;

// A run of bytes of the text, not terminated.
struct span {
  const char* p;
  size_t n;
};

bool is_blank(char c) {
  return c == ' ' || c == '\t' || c == '\r' || c == '\v' || c == '\f';
}

span trim(span s) {
  while (s.n > 0 && is_blank(s.p[0])) {
    ++s.p;
    --s.n;
  }
  while (s.n > 0 && is_blank(s.p[s.n - 1])) --s.n;
  return s;
}

bool equals(span s, const char* word) {
  const size_t n = strlen(word);
  return s.n == n && memcmp(s.p, word, n) == 0;
}

// Decimal with an optional sign, within [lowest, highest].
bool parse_decimal(span s, long long lowest, long long highest, long long* out) {
  size_t i = 0;
  bool negative = false;
  if (i < s.n && (s.p[i] == '-' || s.p[i] == '+')) negative = s.p[i++] == '-';
  if (i == s.n) return false;
  long long v = 0;
  for (; i < s.n; ++i) {
    if (s.p[i] < '0' || s.p[i] > '9') return false;
    v = v * 10 + (s.p[i] - '0');
    if (v > (1LL << 32)) return false;  // far outside every range asked for; stops overflow
  }
  if (negative) v = -v;
  if (v < lowest || v > highest) return false;
  *out = v;
  return true;
}

bool parse_item_id(span s, uint16_t* id) {
  long long v = 0;
  if (s.n == 0 || s.p[0] == '-' || s.p[0] == '+' || !parse_decimal(s, 0, 0xFFFF, &v)) {
    return false;
  }
  *id = static_cast<uint16_t>(v);
  return true;
}

bool parse_result(span s, int* r) {
  long long v = 0;
  if (!parse_decimal(s, INT32_MIN, INT32_MAX, &v)) return false;
  *r = static_cast<int>(v);
  return true;
}

int hex_digit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

bool parse_hex_bytes(span s, std::vector<uint8_t>* out) {
  size_t i = 0;
  while (i < s.n) {
    if (is_blank(s.p[i])) {
      ++i;
      continue;
    }
    size_t end = i;
    while (end < s.n && !is_blank(s.p[end])) ++end;
    const size_t digits = end - i;
    if (digits > 2 && digits % 2 != 0) return false;
    for (size_t k = i; k < end; k += 2) {
      const int high = hex_digit(s.p[k]);
      const int low = (digits == 1) ? 0 : hex_digit(s.p[k + 1]);
      if (high < 0 || low < 0) return false;
      if (out->size() == kMaxItemLength) return false;
      out->push_back(static_cast<uint8_t>(digits == 1 ? high : high * 16 + low));
    }
    i = end;
  }
  return true;
}

// One line, without its newline. Returns whether it was taken.
bool parse_line(span line, registry_contents* c) {
  for (size_t i = 0; i < line.n; ++i) {
    if (line.p[i] == '#') {
      line.n = i;
      break;
    }
  }
  line = trim(line);
  if (line.n == 0) return false;
  const char* eq = static_cast<const char*>(memchr(line.p, '=', line.n));
  if (eq == nullptr) return false;
  const span key = trim({line.p, static_cast<size_t>(eq - line.p)});
  const span value = trim({eq + 1, line.n - static_cast<size_t>(eq - line.p) - 1});

  if (equals(key, "open_failures")) {
    long long n = 0;
    if (!parse_decimal(value, 0, INT32_MAX, &n)) return false;
    c->open_failures = static_cast<int>(n);
    return true;
  }
  if (equals(key, "close_result")) return parse_result(value, &c->close_result);

  static const char kReadError[] = "read_error";
  const size_t prefix = sizeof kReadError - 1;
  if (key.n > prefix && memcmp(key.p, kReadError, prefix) == 0 && is_blank(key.p[prefix])) {
    uint16_t id = 0;
    int r = 0;
    if (!parse_item_id(trim({key.p + prefix, key.n - prefix}), &id) || !parse_result(value, &r)) {
      return false;
    }
    c->read_errors[id] = r;
    return true;
  }

  uint16_t id = 0;
  std::vector<uint8_t> bytes;
  if (!parse_item_id(key, &id) || !parse_hex_bytes(value, &bytes)) return false;
  c->items[id] = bytes;
  return true;
}

int parse_text(const char* text, size_t length, registry_contents* c) {
  int taken = 0;
  size_t start = 0;
  while (start < length) {
    const char* nl = static_cast<const char*>(memchr(text + start, '\n', length - start));
    const size_t end = nl != nullptr ? static_cast<size_t>(nl - text) : length;
    if (parse_line({text + start, end - start}, c)) ++taken;
    start = end + 1;
  }
  return taken;
}

uint64_t fnv1a(const std::string& s) {
  uint64_t h = 1469598103934665603ULL;
  for (unsigned char ch : s) {
    h ^= ch;
    h *= 1099511628211ULL;
  }
  return h;
}

// Reads the registry file; an absent or unreadable file reads as empty text.
file_version read_registry_file(std::string* text) {
  file_version v;
  const char* path = host_environment().sensor_reg;
  if (path == nullptr) return v;
  const int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return v;
  struct stat st;
  if (fstat(fd, &st) == 0) {
    v.exists = true;
    v.device = st.st_dev;
    v.inode = st.st_ino;
    v.size = st.st_size;
    v.mtime = st.st_mtim;
    char chunk[4096];
    while (text->size() < kMaxFileBytes) {
      const ssize_t n = read(fd, chunk, sizeof chunk);
      if (n <= 0) break;
      text->append(chunk, static_cast<size_t>(n));
    }
    if (text->size() > kMaxFileBytes) text->resize(kMaxFileBytes);
    v.hash = fnv1a(*text);
  }
  close(fd);
  return v;
}

}  // namespace

extern "C" int sensor_reg_open(void) {
  std::string text;
  const file_version version = read_registry_file(&text);
  registry_contents contents;
  parse_text(text.data(), text.size(), &contents);

  pthread_mutex_lock(&g_lock);
  if (!version.same_as(g_counted_version)) {
    g_counted_version = version;
    g_failures_used = 0;
  }
  int r = 0;
  if (g_failures_used < contents.open_failures) {
    ++g_failures_used;
    r = -1;
  }
  g_contents = contents;
  g_open = r == 0;
  pthread_mutex_unlock(&g_lock);
  __android_log_print(ANDROID_LOG_INFO, kTag, "open -> %d", r);
  return r;
}

extern "C" int sensor_reg_read(uint16_t item_id, uint32_t, uint8_t** data, uint8_t* len) {
  int r = -1;
  uint8_t length = 0;
  uint8_t* copy = nullptr;
  pthread_mutex_lock(&g_lock);
  if (g_open) {
    const auto error = g_contents.read_errors.find(item_id);
    const auto item = g_contents.items.find(item_id);
    if (error != g_contents.read_errors.end()) {
      r = error->second;
    } else if (item != g_contents.items.end()) {
      const std::vector<uint8_t>& bytes = item->second;
      // Even an item of no bytes hands over a block, so the caller's free() always has one.
      copy = static_cast<uint8_t*>(malloc(bytes.empty() ? 1 : bytes.size()));
      if (copy != nullptr) {
        if (!bytes.empty()) memcpy(copy, bytes.data(), bytes.size());
        length = static_cast<uint8_t>(bytes.size());
        r = 0;
      }
    }
  }
  pthread_mutex_unlock(&g_lock);
  if (data != nullptr) {
    *data = copy;
  } else {
    free(copy);
  }
  if (len != nullptr) *len = length;
  __android_log_print(ANDROID_LOG_INFO, kTag, "read %u -> %d len %u", item_id, r, length);
  return r;
}

extern "C" int sensor_reg_close(void) {
  pthread_mutex_lock(&g_lock);
  const int r = g_contents.close_result;
  g_open = false;
  pthread_mutex_unlock(&g_lock);
  __android_log_print(ANDROID_LOG_INFO, kTag, "close -> %d", r);
  return r;
}

extern "C" int sensor_reg_host_parse(const char* text, size_t length) {
  registry_contents contents;
  return parse_text(text, length, &contents);
}
