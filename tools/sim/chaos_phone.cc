// SPDX-License-Identifier: Apache-2.0
#include "tools/sim/chaos_phone.h"

#include <algorithm>

namespace kestrel_sim {

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::microseconds;

constexpr uint32_t kServiceSmgr = 0;
constexpr int32_t kMsgStatus = 11;
constexpr int32_t kMsgSingleSensorTest = 13;
constexpr int32_t kEwouldblock = 11;
// Fewer refused opens in a run than the daemon's budget of consecutive failures, so it reopens.
constexpr int kMaxRefusedRun = 40;

// Requests whose answer a command waits for: a test indication follows them.
bool awaited(const Request& r) {
  return r.header.service == kServiceSmgr &&
         (r.header.msg_id == kMsgSingleSensorTest || r.header.msg_id == kMsgStatus);
}

// Weights of the link faults the schedule draws, and of the choices made for each request (per
// thousand requests; the rest is answered at once).
struct Weighted {
  ChaosFault fault;
  int weight;
};
constexpr Weighted kLinkFaults[] = {
    {ChaosFault::kDrop, 20},       {ChaosFault::kRefusedOpens, 10}, {ChaosFault::kAllocFault, 12},
    {ChaosFault::kWriteFault, 20}, {ChaosFault::kCloseFault, 1},    {ChaosFault::kRetryOpen, 10},
    {ChaosFault::kHeldOpen, 12},
};
constexpr Weighted kRequestFaults[] = {
    {ChaosFault::kDropAtWrite, 30}, {ChaosFault::kDropInWait, 40}, {ChaosFault::kMissing, 40},
    {ChaosFault::kLate, 40},        {ChaosFault::kDuplicated, 40},
};

template <size_t N>
ChaosFault draw(const Weighted (&table)[N], int roll) {
  for (const Weighted& w : table) {
    if (roll < w.weight) return w.fault;
    roll -= w.weight;
  }
  return table[N - 1].fault;
}

template <size_t N>
int total(const Weighted (&table)[N]) {
  int sum = 0;
  for (const Weighted& w : table) sum += w.weight;
  return sum;
}

int uniform(std::mt19937_64& rng, int lo, int hi) {
  return std::uniform_int_distribution<int>(lo, hi)(rng);
}

}  // namespace

const char* chaos_fault_name(ChaosFault fault) {
  switch (fault) {
    case ChaosFault::kDrop:
      return "connection dropped";
    case ChaosFault::kDropAtWrite:
      return "dropped as a request arrived";
    case ChaosFault::kDropInWait:
      return "dropped during a wait";
    case ChaosFault::kRefusedOpens:
      return "run of refused opens";
    case ChaosFault::kAllocFault:
      return "FAULT alloc";
    case ChaosFault::kWriteFault:
      return "FAULT write";
    case ChaosFault::kCloseFault:
      return "FAULT close";
    case ChaosFault::kLate:
      return "answer late past the wait";
    case ChaosFault::kMissing:
      return "answer missing";
    case ChaosFault::kDuplicated:
      return "answer duplicated";
    case ChaosFault::kRetryOpen:
      return "RETRY_OPEN";
    case ChaosFault::kHeldOpen:
      return "open held";
  }
  return "?";
}

ChaosPhone::ChaosPhone(Simulator& sim, const ChaosSettings& settings)
    : sim_(sim),
      settings_(settings),
      phone_(sim),
      schedule_rng_(settings.seed),
      request_rng_(settings.seed ^ 0x9e3779b97f4a7c15ull) {
  sim_.set_request_hook([this](Simulator&, const Request& r) { on_request(r); });
  schedule_thread_ = std::thread([this] { run_schedule(); });
  timer_thread_ = std::thread([this] { run_timers(); });
}

ChaosPhone::~ChaosPhone() {
  sim_.set_request_hook(nullptr);
  {
    std::lock_guard<std::mutex> lock(mu_);
    stopping_ = true;
  }
  cv_.notify_all();
  schedule_thread_.join();
  timer_thread_.join();
  phone_.stop();
}

void ChaosPhone::enable(bool on) {
  {
    std::lock_guard<std::mutex> lock(mu_);
    enabled_ = on;
  }
  if (!on) {
    sim_.refuse_opens(0, 0);
    sim_.hold_opens(Millis(0), 0);
    sim_.release_held_opens();
  }
  cv_.notify_all();
}

bool ChaosPhone::settled() const {
  std::lock_guard<std::mutex> lock(mu_);
  return timers_.empty() && running_actions_ == 0;
}

std::array<long, kChaosFaultKinds> ChaosPhone::injected() const {
  std::lock_guard<std::mutex> lock(mu_);
  return injected_;
}

void ChaosPhone::count(ChaosFault fault) {
  std::lock_guard<std::mutex> lock(mu_);
  ++injected_[static_cast<size_t>(fault)];
}

microseconds ChaosPhone::wait_time() const {
  return microseconds(static_cast<long>(8e6 * settings_.time_scale));
}

void ChaosPhone::later(microseconds delay, Action action) {
  {
    std::lock_guard<std::mutex> lock(mu_);
    timers_.emplace_back(Clock::now() + delay, std::move(action));
  }
  cv_.notify_all();
}

void ChaosPhone::on_request(const Request& r) {
  bool on;
  {
    std::lock_guard<std::mutex> lock(mu_);
    on = enabled_;
  }
  // The draws are made whether faults are on or not, so the sequence depends on the requests
  // alone.
  const int roll = uniform(request_rng_, 0, 999);
  const int extra = uniform(request_rng_, 0, 999);
  if (!on || roll >= total(kRequestFaults)) {
    phone_.answer(r);
    return;
  }
  ChaosFault fault = draw(kRequestFaults, roll);
  if (fault == ChaosFault::kDropInWait && !awaited(r)) fault = ChaosFault::kMissing;
  count(fault);
  const microseconds wait = wait_time();
  switch (fault) {
    case ChaosFault::kDropAtWrite:
      sim_.drop_connection();
      break;
    case ChaosFault::kDropInWait:
      // Somewhere within the wait, the answer not given.
      later(wait * (50 + extra * 9 / 10) / 1000, [this] { sim_.drop_connection(); });
      break;
    case ChaosFault::kMissing:
      break;
    case ChaosFault::kLate:
      // From a tenth to twice the wait after it has ended.
      later(wait * (1100 + extra * 19 / 10) / 1000, [this, r] { phone_.answer(r); });
      break;
    default:  // duplicated
      phone_.answer(r);
      phone_.answer(r);
      break;
  }
}

// Applies one link fault of the schedule; false when the library did not acknowledge it.
bool ChaosPhone::apply_link_fault(ChaosFault fault, int extra) {
  bool done = true;
  switch (fault) {
    case ChaosFault::kDrop:
      sim_.drop_connection();
      break;
    case ChaosFault::kRefusedOpens:
      sim_.refuse_opens(extra % 2 == 0 ? kEwouldblock : 5, 1 + extra % kMaxRefusedRun);
      sim_.drop_connection();
      break;
    case ChaosFault::kAllocFault:
      done = sim_.fault(FaultOp::kAlloc, 12, 1 + extra % 3, std::chrono::milliseconds(500));
      break;
    case ChaosFault::kWriteFault:
      done = sim_.fault(FaultOp::kWrite, extra % 3 == 0 ? kEwouldblock : 5, 1 + extra % 2,
                        std::chrono::milliseconds(500));
      break;
    case ChaosFault::kCloseFault:
      done = sim_.fault(FaultOp::kClose, settings_.close_status, 1, std::chrono::milliseconds(500));
      break;
    case ChaosFault::kHeldOpen: {
      // From half a second to five of the daemon's time: often past the three tries of its
      // reopen, so another thread's command may be the one that opens. Every other time the
      // link is reported broken while the open is held.
      const auto hold = std::chrono::duration_cast<Millis>(
          std::chrono::duration<double, std::milli>((500 + extra * 9 / 2) * settings_.time_scale));
      sim_.hold_opens(hold, 1);
      sim_.drop_connection();
      if (extra % 2 == 0 && sim_.wait_for_held_open(Millis(2000) + hold)) {
        sim_.callback_to_held_open(250, true, false, Header{}, {});
      }
      break;
    }
    default:  // RETRY_OPEN
      sim_.retry_open();
      break;
  }
  return done;
}

void ChaosPhone::run_schedule() {
  std::unique_lock<std::mutex> lock(mu_);
  for (;;) {
    const auto pause = std::chrono::milliseconds(
        uniform(schedule_rng_, static_cast<int>(settings_.min_pause.count()),
                static_cast<int>(settings_.max_pause.count())));
    const int roll = uniform(schedule_rng_, 0, total(kLinkFaults) - 1);
    const int extra = uniform(schedule_rng_, 0, 999);
    cv_.wait_for(lock, pause, [&] { return stopping_; });
    cv_.wait(lock, [&] { return stopping_ || enabled_; });
    if (stopping_) return;
    ChaosFault fault = draw(kLinkFaults, roll);
    // A new run of refusals only once the daemon has opened since the last one: two runs back to
    // back would spend its budget, and it would stay without a link until restarted.
    if (fault == ChaosFault::kRefusedOpens &&
        sim_.opened_connections() == opened_at_last_refusal_) {
      fault = ChaosFault::kDrop;
    }
    if (fault == ChaosFault::kRefusedOpens) opened_at_last_refusal_ = sim_.opened_connections();
    lock.unlock();
    if (apply_link_fault(fault, extra)) count(fault);
    lock.lock();
  }
}

void ChaosPhone::run_timers() {
  std::unique_lock<std::mutex> lock(mu_);
  for (;;) {
    if (stopping_) return;
    if (timers_.empty()) {
      cv_.wait(lock);
      continue;
    }
    auto first = std::min_element(timers_.begin(), timers_.end(),
                                  [](const auto& a, const auto& b) { return a.first < b.first; });
    if (Clock::now() < first->first) {
      cv_.wait_until(lock, first->first);
      continue;
    }
    Action action = std::move(first->second);
    timers_.erase(first);
    ++running_actions_;
    lock.unlock();
    action();
    lock.lock();
    --running_actions_;
  }
}

}  // namespace kestrel_sim
