// SPDX-License-Identifier: Apache-2.0
// A sensor1 client for tests of the library and the simulator: a connection whose callback
// records every delivery (type, header, body bytes) and releases the body as the daemon does.
#pragma once

#include <string.h>

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "sensor1.h"
#include "sensor1_host.h"
#include "test_env.h"

struct Delivery {
  int type = 0;
  bool has_header = false;
  bool has_body = false;
  sensor1_msg_header_s header{};
  std::vector<uint8_t> body;  // msg_size bytes, when both header and body came
};

// "1 [0 64 3 3] 010203": type, [service msg_id msg_size txn_id], the body in hex; a null header
// or body reads "no header" or "no body", and a body under a null header "body".
inline std::string summary(const Delivery& d) {
  const sensor1_msg_header_s& h = d.header;
  std::string s = std::to_string(d.type) + " ";
  if (!d.has_header) return s + (d.has_body ? "no header body" : "no header no body");
  s += "[" + std::to_string(h.service_number) + " " + std::to_string(h.msg_id) + " " +
       std::to_string(h.msg_size) + " " + std::to_string(h.txn_id) + "]";
  if (!d.has_body) return s + " no body";
  s += " ";
  static const char kHex[] = "0123456789abcdef";
  for (const uint8_t b : d.body) s += {kHex[b >> 4], kHex[b & 15]};
  return s;
}

// One sensor1_write of body in a buffer of the library. When the write leaves the body to the
// caller, it is in *left (or leaks, which the tests' count of outstanding bodies reports).
inline int write_request(sensor1_handle_s* h, sensor1_msg_header_s hdr,
                         const std::vector<uint8_t>& body, void** left = nullptr) {
  void* buf = nullptr;
  const int alloc = sensor1_alloc_msg_buf(h, static_cast<uint16_t>(body.size()), &buf);
  if (alloc != 0) return alloc;
  if (!body.empty()) memcpy(buf, body.data(), body.size());
  hdr.msg_size = static_cast<uint16_t>(body.size());
  if (left != nullptr) *left = buf;
  return sensor1_write(h, &hdr, buf);
}

// One connection whose callback records every delivery.
class Sensor1Recorder {
 public:
  // action runs inside the callback, on the library's thread, before the delivery is recorded.
  explicit Sensor1Recorder(std::function<void(const Delivery&)> action = nullptr)
      : core_(std::make_shared<Core>(std::move(action))) {}

  // Returns sensor1_open's result.
  int open(sensor1_handle_s** handle) {
    // A late callback may outlive the recorder: what it records is kept alive to the end.
    static std::mutex mu;
    static auto* kept = new std::deque<std::shared_ptr<Core>>();
    std::lock_guard<std::mutex> lock(mu);
    kept->push_back(core_);
    return sensor1_open(handle, &callback, reinterpret_cast<intptr_t>(core_.get()));
  }

  std::vector<Delivery> deliveries() const {
    std::lock_guard<std::mutex> lock(core_->mu);
    return core_->log;
  }

  std::vector<std::string> summaries() const {
    std::vector<std::string> out;
    for (const Delivery& d : deliveries()) out.push_back(summary(d));
    return out;
  }

  // Waits until at least n deliveries have been recorded.
  bool wait_for(size_t n, std::chrono::milliseconds timeout = std::chrono::seconds(5)) const {
    std::unique_lock<std::mutex> lock(core_->mu);
    return core_->cv.wait_for(lock, timeout, [&] { return core_->log.size() >= n; });
  }

 private:
  struct Core {
    explicit Core(std::function<void(const Delivery&)> a) : action(std::move(a)) {}
    std::mutex mu;
    std::condition_variable cv;
    std::vector<Delivery> log;
    const std::function<void(const Delivery&)> action;
  };

  static void callback(intptr_t data, sensor1_msg_header_s* hdr, int type, void* msg) {
    Core* core = reinterpret_cast<Core*>(data);
    Delivery d{type, hdr != nullptr, msg != nullptr, {}, {}};
    if (hdr != nullptr) d.header = *hdr;
    const uint8_t* p = static_cast<const uint8_t*>(msg);
    if (hdr != nullptr && p != nullptr) d.body.assign(p, p + hdr->msg_size);
    sensor1_free_msg_buf(nullptr, msg);
    if (core->action) core->action(d);
    std::lock_guard<std::mutex> lock(core->mu);
    core->log.push_back(d);
    core->cv.notify_all();
  }

  std::shared_ptr<Core> core_;
};
