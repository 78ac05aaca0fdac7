// The healthy phone: answers every request of the daemon the way a working sensor processor
// would, with values a factory engineer recognises (gravity on the accelerometer's z axis, a
// still gyroscope, the earth's field on the magnetometer, sea-level air pressure, passing self
// tests). Streams started by a report request or a light-sensor polling request send their
// indications from a thread of their own until they are stopped or their connection ends.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "tools/sim/simulator.h"

namespace kestrel_sim {

class HealthyPhone {
 public:
  explicit HealthyPhone(Simulator& sim);
  ~HealthyPhone();  // stops the stream thread
  HealthyPhone(const HealthyPhone&) = delete;
  HealthyPhone& operator=(const HealthyPhone&) = delete;

  // Sends the response (and indications, or a stream start or stop) for one request, to the
  // request's connection.
  void answer(const Request& request);

  // Stops every stream; once it returns, no stream sends again.
  void stop_streams();
  // Stops every stream and joins the stream thread.
  void stop();

  // Number of streams running (for tests and the program's status line).
  size_t stream_count() const;

 private:
  struct Stream {
    uint64_t id = 0;  // unique over the phone's life
    int connection = 0;
    uint32_t service = 0;
    uint32_t key = 0;    // report id (service 0) or indication code (service 44)
    uint8_t sensor = 0;  // sensor-manager id (service 0)
    std::chrono::microseconds period{0};
    std::chrono::steady_clock::time_point next;
    uint32_t tick = 0;
  };

  void start_stream(const Stream& stream);
  void stop_stream(int connection, uint32_t service, uint32_t key);
  void run_streams();
  bool send_sample(Stream& stream);

  // Removes the streams that match; once it returns none of them sends again.
  template <typename Match>
  void remove_streams(Match match);

  Simulator& sim_;
  // Held by the stream thread while it sends, so that a stop waits for a sample in flight.
  std::mutex send_mu_;
  mutable std::mutex mu_;  // guards what follows
  std::condition_variable cv_;
  std::vector<Stream> streams_;
  uint64_t next_id_ = 1;
  bool stopping_ = false;
  std::thread thread_;
};

// One readable line about a request, e.g.
// "svc 0 msg 13 txn 4 size 12: self test SensorID 0 TestType 6".
std::string describe_request(const Request& request);

}  // namespace kestrel_sim
