#include "inprocess_sensor1.h"

#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <atomic>
#include <vector>

#include "byte_order.h"
#include "fuzz_support.h"
#include "sensor1.h"

struct sensor1_handle_s {
  sensor1_notify_data_cb_t cb;
  intptr_t cb_data;
  bool open;
};

namespace kestrel_fuzz {

namespace {

constexpr int kEinval = 22;
constexpr int kEnomem = 12;
constexpr size_t kSlots = 8;

sensor1_handle_s g_slots[kSlots];
size_t g_next_slot = 0;
sensor1_behaviour g_behaviour;
std::atomic<long> g_outstanding{0};

bool usable(const sensor1_handle_s* h) {
  return h >= g_slots && h < g_slots + kSlots && h->open;
}

// Sensor-manager ids that exist on the phone.
bool known_sensor(uint8_t id) {
  return id == 0 || id == 10 || id == 20 || id == 30 || id == 40 || id == 60;
}

struct message {
  sensor1_msg_header_s header;
  std::vector<uint8_t> body;
};

std::vector<uint8_t> response_body(size_t size) {
  std::vector<uint8_t> b(size, 0);
  if (g_behaviour.failed_responses) {
    b[0] = 1;
    b[1] = 3;
  }
  return b;
}

void deliver(sensor1_handle_s* h, int type, const sensor1_msg_header_s& header,
             const std::vector<uint8_t>& bytes) {
  void* body = alloc_callback_body(bytes.size());
  if (!bytes.empty()) memcpy(body, bytes.data(), bytes.size());
  sensor1_msg_header_s hdr = header;
  hdr.msg_size = static_cast<uint16_t>(bytes.size());
  h->cb(h->cb_data, &hdr, type, body);
}

// The result words of a test, by sensor and test type (word 0 says which test they hold).
std::vector<int32_t> test_words(uint8_t sensor, int32_t test_type, bool calibration) {
  switch (sensor) {
    case 0:
      if (test_type == 6) return {1, 9, -14, 1010, 1, 298, -301, 402};
      if (test_type == 11 || test_type == 12) return {test_type, test_type == 11 ? 1 : 0};
      if (calibration) return {1, 18, -37, 7};
      return {1};
    case 10:
      if (test_type == 6) return {1, 1, 1320, -790, 455, 1, 10, -7, 3, 398, -405, 441};
      if (test_type == 13) return {2, 1835008};
      return {3, 1, 1320, -790, 455};
    case 20:
      if (test_type == 6) return {1, 0, -28, 17, -690, 31, -40, 176, 1, 1};
      if (test_type == 9) return {2, -3, 1};
      if (test_type == 10) {
        return {0x48, 0x09, 0x01, 0x2C, 0x00, 0xE4, 0xFF, 0x8A, 0xFE, 0x00, 0x18, 0x08, 0x00, 0x00};
      }
      if (calibration) return {1, 12, -5, 8};
      return {1};
    case 30:
      return {1, 101280};
    default:
      return {};
  }
}

std::vector<uint8_t> test_indication(uint8_t sensor, int32_t test_type,
                                     const std::vector<int32_t>& words) {
  std::vector<uint8_t> b(84, 0);
  store_u8(b.data(), 0, sensor);
  store_i32(b.data(), 4, test_type);
  switch (g_behaviour.outcome) {
    case test_outcome::kPassed:
      break;
    case test_outcome::kFailedWithCode:
      store_u32(b.data(), 8, 1);
      store_u8(b.data(), 12, 1);
      store_u8(b.data(), 13, 7);
      break;
    case test_outcome::kFailedWithoutCode:
      store_u32(b.data(), 8, 1);
      break;
  }
  for (size_t i = 0; i < words.size() && i < 16; ++i) store_i32(b.data(), 20 + 4 * i, words[i]);
  return b;
}

// The fixed size and the transaction ids of every request the daemon writes.
void check_request(const sensor1_msg_header_s& h, const uint8_t* body) {
  const unsigned txn = h.txn_id;
  bool ok = false;
  if (h.service_number == 0) {
    switch (h.msg_id) {
      case 2:
        ok = h.msg_size == 272 && txn == 2;
        break;
      case 11:
        ok = h.msg_size == 3 && txn == 6;
        break;
      case 13:
        ok = h.msg_size == 12 && txn == 4 && body[1] == 0;
        break;
      case 38:
        ok = h.msg_size == 3 && txn == 4;
        break;
      case 64:
        ok = h.msg_size == 1 && txn == 0 && body[0] == 0xAA;
        break;
      default:
        break;
    }
  } else if (h.service_number == 44 && h.msg_id == 32 && h.msg_size == 288) {
    ok = (txn == 7 || txn == 123 || (txn >= 167 && txn <= 174)) && body[20] == 1 &&
         body[284] == 0 && load_u32(body, 24) <= 256;
  }
  if (!ok) {
    fail("request service %u msg %d size %u txn %u breaks the request rules", h.service_number,
         h.msg_id, h.msg_size, txn);
  }
}

void answer_smgr(sensor1_handle_s* h, const message& req) {
  const uint8_t* body = req.body.data();
  sensor1_msg_header_s resp = req.header;
  sensor1_msg_header_s ind = {0, 13, 0, req.header.txn_id};
  switch (req.header.msg_id) {
    case 64: {
      std::vector<uint8_t> r = response_body(4 + 12 * 16);
      const uint8_t ids[] = {0, 10, 20, 30, 40, 60};
      for (size_t i = 0; i < 12; ++i) {
        uint8_t* rec = r.data() + 4 + i * 16;
        rec[0] = i < sizeof ids ? ids[i] : 255;
        if (i < sizeof ids) {
          rec[1] = 1;
          rec[3] = 0x0A;
          rec[4] = 0x64;
          rec[12] = 1;
        }
      }
      deliver(h, 1, resp, r);
      return;
    }
    case 11: {
      deliver(h, 1, resp, response_body(3));
      if (known_sensor(body[0]) && !g_behaviour.no_indications) {
        deliver(h, 2, ind, test_indication(body[0], 3, {}));
      }
      return;
    }
    case 13: {
      deliver(h, 1, resp, response_body(2));
      const uint8_t sensor = body[0];
      const int32_t test_type = load_i32(body, 4);
      const bool calibration = body[8] == 1 && body[9] == 1 && body[10] == 1 && body[11] == 1;
      if (known_sensor(sensor) && !g_behaviour.no_indications) {
        deliver(h, 2, ind,
                test_indication(sensor, test_type, test_words(sensor, test_type, calibration)));
      }
      return;
    }
    case 2: {
      std::vector<uint8_t> r = response_body(12);
      const uint8_t sensor = body[12];
      r[8] = sensor;
      deliver(h, 1, resp, r);
      if (body[1] == 1 && !g_behaviour.no_indications) {
        std::vector<uint8_t> s(24, 0);
        store_u8(s.data(), 8, sensor);
        store_i32(s.data(), 12, 6553);
        store_i32(s.data(), 16, -13107);
        store_i32(s.data(), 20, 642252);
        deliver(h, 2, {0, 3, 0, 0}, s);
      }
      return;
    }
    default:
      deliver(h, 1, resp, response_body(2));
      return;
  }
}

void answer_daf(sensor1_handle_s* h, const message& req) {
  const uint8_t* body = req.body.data();
  const uint32_t id = load_u32(body, 16);
  std::vector<uint8_t> r = response_body(140);
  const uint8_t txn = req.header.txn_id;
  if (txn >= 169 && txn <= 174) {
    for (size_t i = 0; i < 128; ++i) r[12 + i] = static_cast<uint8_t>(i * 7 + txn);
  }
  if (id == 100006 || id == 100007) {
    store_i32(r.data(), 12, 2600);
    store_i32(r.data(), 16, 1800);
  } else if (id == 100008 || id == 100009) {
    store_i32(r.data(), 20, 3100);
    store_i32(r.data(), 24, 2300);
  }
  deliver(h, 1, req.header, r);
  if ((id == 60 || id == 50) && !g_behaviour.no_indications) {
    std::vector<uint8_t> ind(32, 0);
    store_u8(ind.data(), 0, id == 60 ? 61 : 51);
    store_u8(ind.data(), 1, 1);
    store_u32(ind.data(), 4, id == 60 ? 24 : 8);
    const int32_t data[6] = {1650, 410, 730, 290, 5200, 62};
    for (size_t i = 0; i < 6; ++i) store_i32(ind.data(), 8 + 4 * i, data[i]);
    deliver(h, 2, {44, 33, 0, 0}, ind);
  }
}

}  // namespace

void set_sensor1_behaviour(const sensor1_behaviour& behaviour) {
  g_behaviour = behaviour;
}

void* alloc_callback_body(size_t size) {
  // malloc(0) still gives a block of its own, with no byte that may be read.
  void* p = malloc(size);
  if (p == nullptr) fail("out of memory");
  g_outstanding.fetch_add(1);
  return p;
}

long outstanding_bodies() {
  return g_outstanding.load();
}

}  // namespace kestrel_fuzz

using kestrel_fuzz::g_behaviour;

extern "C" {

int sensor1_init(void) {
  return 0;
}

int sensor1_open(sensor1_handle_s** handle, sensor1_notify_data_cb_t cb, intptr_t cb_data) {
  if (handle == nullptr || cb == nullptr) return kestrel_fuzz::kEinval;
  if (g_behaviour.open_fails) return SENSOR1_EWOULDBLOCK;
  sensor1_handle_s* h = &kestrel_fuzz::g_slots[kestrel_fuzz::g_next_slot];
  kestrel_fuzz::g_next_slot = (kestrel_fuzz::g_next_slot + 1) % kestrel_fuzz::kSlots;
  h->cb = cb;
  h->cb_data = cb_data;
  h->open = true;
  *handle = h;
  return SENSOR1_SUCCESS;
}

int sensor1_close(sensor1_handle_s* handle) {
  if (!kestrel_fuzz::usable(handle)) return kestrel_fuzz::kEinval;
  handle->open = false;
  return SENSOR1_SUCCESS;
}

int sensor1_alloc_msg_buf(sensor1_handle_s* handle, uint16_t size, void** buf) {
  if (buf == nullptr) return kestrel_fuzz::kEinval;
  *buf = nullptr;
  if (!kestrel_fuzz::usable(handle)) return kestrel_fuzz::kEinval;
  if (g_behaviour.alloc_fails) return kestrel_fuzz::kEnomem;
  *buf = kestrel_fuzz::alloc_callback_body(size);
  return SENSOR1_SUCCESS;
}

int sensor1_free_msg_buf(sensor1_handle_s*, void* buf) {
  // Any handle will do: after a broken link the daemon frees with whatever handle is current.
  if (buf == nullptr) return SENSOR1_SUCCESS;
  free(buf);
  if (kestrel_fuzz::g_outstanding.fetch_sub(1) <= 0) kestrel_fuzz::fail("body freed twice");
  return SENSOR1_SUCCESS;
}

int sensor1_write(sensor1_handle_s* handle, sensor1_msg_header_s* hdr, void* body) {
  if (!kestrel_fuzz::usable(handle) || hdr == nullptr) return kestrel_fuzz::kEinval;
  if (body == nullptr && hdr->msg_size != 0) return kestrel_fuzz::kEinval;
  kestrel_fuzz::check_request(*hdr, static_cast<const uint8_t*>(body));
  const int result = g_behaviour.write_result;
  if (result != SENSOR1_SUCCESS && result != SENSOR1_EWOULDBLOCK) return result;
  // The library owns the body from here on.
  kestrel_fuzz::message req;
  req.header = *hdr;
  req.body.assign(static_cast<const uint8_t*>(body),
                  static_cast<const uint8_t*>(body) + hdr->msg_size);
  sensor1_free_msg_buf(handle, body);
  if (result == SENSOR1_EWOULDBLOCK) return result;
  if (req.header.service_number == 44) {
    kestrel_fuzz::answer_daf(handle, req);
  } else {
    kestrel_fuzz::answer_smgr(handle, req);
  }
  return SENSOR1_SUCCESS;
}

}  // extern "C"
