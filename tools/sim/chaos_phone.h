// SPDX-License-Identifier: Apache-2.0
// A sensor processor under chaos: the healthy phone's answers, spoiled by a seeded random schedule
// of the faults a real link shows in bursts and at the worst moments. The connection is dropped at
// random moments, as a request arrives and while the daemon waits for its answer; opens are
// refused in runs or held (a slow service, the link sometimes reported broken while the open is
// held); FAULT records make the library's alloc, write and close fail; answers come
// late (past the daemon's wait), never, or twice; RETRY_OPEN comes out of the blue.
//
// The schedule of link faults runs on a thread of its own, the choice for each request on the
// simulator's connection thread, each from its own generator seeded from the one seed, so a seed
// replays the same sequence of choices.
#pragma once

#include <stdint.h>

#include <array>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <random>
#include <thread>
#include <vector>

#include "tools/sim/healthy_phone.h"
#include "tools/sim/simulator.h"

namespace kestrel_sim {

enum class ChaosFault {
  kDrop,          // the connection dropped at a random moment
  kDropAtWrite,   // dropped as a request arrives
  kDropInWait,    // dropped while the daemon waits for the answer
  kRefusedOpens,  // a run of refused opens, then a drop so that the daemon reopens
  kAllocFault,    // FAULT: allocations fail
  kWriteFault,    // FAULT: writes fail (or answer EWOULDBLOCK)
  kCloseFault,    // FAULT: the next close fails with the exit status
  kLate,          // an answer sent after the daemon's wait has ended
  kMissing,       // an answer never sent
  kDuplicated,    // an answer sent twice
  kRetryOpen,     // RETRY_OPEN
  kHeldOpen,      // the next open answered late, sometimes broken meanwhile; then a drop
};
constexpr size_t kChaosFaultKinds = 12;
const char* chaos_fault_name(ChaosFault fault);

struct ChaosSettings {
  uint64_t seed = 1;
  // The daemon's KESTREL_TIME_SCALE: its 8 s wait lasts 8 s times this.
  double time_scale = 0.05;
  // The result of a faulted close. A write failure whose close fails ends the daemon with it.
  int32_t close_status = 77;
  // Pause between two link faults, drawn evenly from this range.
  std::chrono::milliseconds min_pause{40};
  std::chrono::milliseconds max_pause{400};
};

class ChaosPhone {
 public:
  // Takes over answering sim's requests (sim must not answer as a healthy phone itself). Faults
  // are off until enable(true).
  ChaosPhone(Simulator& sim, const ChaosSettings& settings);
  ~ChaosPhone();
  ChaosPhone(const ChaosPhone&) = delete;
  ChaosPhone& operator=(const ChaosPhone&) = delete;

  // Faults on or off. Off: every request is answered at once and opens are accepted; answers
  // and drops already planned still happen (see settled()).
  void enable(bool on);
  // True when no late answer or planned drop is still to come.
  bool settled() const;

  // Faults injected so far, by kind.
  std::array<long, kChaosFaultKinds> injected() const;

 private:
  using Action = std::function<void()>;
  void on_request(const Request& request);
  bool apply_link_fault(ChaosFault fault, int extra);
  void run_schedule();
  void run_timers();
  void later(std::chrono::microseconds delay, Action action);
  void count(ChaosFault fault);
  std::chrono::microseconds wait_time() const;  // the daemon's scaled 8 s

  Simulator& sim_;
  const ChaosSettings settings_;
  HealthyPhone phone_;
  std::mt19937_64 schedule_rng_;  // schedule thread only
  std::mt19937_64 request_rng_;   // connection thread only

  mutable std::mutex mu_;  // guards what follows
  std::condition_variable cv_;
  bool enabled_ = false;
  bool stopping_ = false;
  int opened_at_last_refusal_ = -1;
  std::array<long, kChaosFaultKinds> injected_{};
  std::vector<std::pair<std::chrono::steady_clock::time_point, Action>> timers_;
  int running_actions_ = 0;

  std::thread schedule_thread_;
  std::thread timer_thread_;
};

}  // namespace kestrel_sim
