// A sensor1 client for tests of the library and the simulator: opens connections whose callback
// records every delivery (type, header, body bytes) and releases the body as the daemon does.
#pragma once

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "sensor1.h"
#include "sensor1_host.h"

struct Delivery {
  int tag = 0;  // the tag the connection was opened with
  int type = 0;
  bool has_header = false;
  sensor1_msg_header_s header{};
  bool has_body = false;
  std::vector<uint8_t> body;  // msg_size bytes, when both header and body came
};

// One line per delivery, for comparing whole sequences: "1 [0 64 3 3] 010203" is a response
// of service 0, msg_id 64, size 3, txn 3 with its body in hex; a null header or body reads
// "no header" or "no body", and a body under a null header "body".
inline std::string summary(const Delivery& d) {
  std::string s = std::to_string(d.type) + " ";
  if (d.has_header) {
    s += "[" + std::to_string(d.header.service_number) + " " + std::to_string(d.header.msg_id) +
         " " + std::to_string(d.header.msg_size) + " " + std::to_string(d.header.txn_id) + "]";
  } else {
    s += "no header";
  }
  if (!d.has_body) return s + " no body";
  if (!d.has_header) return s + " body";
  s += " ";
  static const char kHex[] = "0123456789abcdef";
  for (uint8_t b : d.body) {
    s += kHex[b >> 4];
    s += kHex[b & 15];
  }
  return s;
}

class Sensor1Recorder {
 public:
  // Runs inside the callback, on the library's thread, before the delivery is recorded.
  using Action = std::function<void(const Delivery&)>;

  Sensor1Recorder() : core_(std::make_shared<Core>()) {}

  // Opens a connection whose deliveries carry tag; returns sensor1_open's result.
  int open(int tag, sensor1_handle_s** handle) {
    return sensor1_open(handle, &Sensor1Recorder::callback, link_for(tag));
  }

  void set_action(Action action) {
    std::lock_guard<std::mutex> lock(core_->mu);
    core_->action = std::move(action);
  }

  std::vector<Delivery> deliveries(int tag = -1) const {
    std::lock_guard<std::mutex> lock(core_->mu);
    std::vector<Delivery> out;
    for (const Delivery& d : core_->log) {
      if (tag < 0 || d.tag == tag) out.push_back(d);
    }
    return out;
  }

  std::vector<std::string> summaries(int tag = -1) const {
    std::vector<std::string> out;
    for (const Delivery& d : deliveries(tag)) out.push_back(summary(d));
    return out;
  }

  // Waits until at least n deliveries (of one tag, or of every tag) have been recorded.
  bool wait_for(size_t n, std::chrono::milliseconds timeout = std::chrono::seconds(5),
                int tag = -1) const {
    std::unique_lock<std::mutex> lock(core_->mu);
    return core_->cv.wait_for(lock, timeout, [&] {
      size_t count = 0;
      for (const Delivery& d : core_->log) count += tag < 0 || d.tag == tag ? 1 : 0;
      return count >= n;
    });
  }

 private:
  struct Core {
    mutable std::mutex mu;
    std::condition_variable cv;
    std::vector<Delivery> log;
    Action action;
  };
  // Callback data. A late callback of a connection may outlive the recorder, so each link keeps
  // the recorded state alive and links are never freed.
  struct Link {
    std::shared_ptr<Core> core;
    int tag;
  };

  intptr_t link_for(int tag) {
    static std::mutex mu;
    static std::deque<Link>* links = new std::deque<Link>();
    std::lock_guard<std::mutex> lock(mu);
    links->push_back({core_, tag});
    return reinterpret_cast<intptr_t>(&links->back());
  }

  static void callback(intptr_t data, sensor1_msg_header_s* hdr, int type, void* msg) {
    const Link* link = reinterpret_cast<const Link*>(data);
    Delivery d;
    d.tag = link->tag;
    d.type = type;
    d.has_header = hdr != nullptr;
    if (hdr != nullptr) d.header = *hdr;
    d.has_body = msg != nullptr;
    if (hdr != nullptr && msg != nullptr) {
      const uint8_t* p = static_cast<const uint8_t*>(msg);
      d.body.assign(p, p + hdr->msg_size);
    }
    sensor1_free_msg_buf(nullptr, msg);
    Action action;
    {
      std::lock_guard<std::mutex> lock(link->core->mu);
      action = link->core->action;
    }
    if (action) action(d);
    {
      std::lock_guard<std::mutex> lock(link->core->mu);
      link->core->log.push_back(d);
    }
    link->core->cv.notify_all();
  }

  std::shared_ptr<Core> core_;
};
