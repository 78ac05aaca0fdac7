// SPDX-License-Identifier: Apache-2.0
// The healthy phone: answers every request of the daemon the way a working sensor processor
// would, with values a factory engineer recognises (gravity on the accelerometer's z axis, a
// still gyroscope, the earth's field on the magnetometer, sea-level air pressure, passing self
// tests). Streams started by a report request or a light-sensor polling request send their
// indications from a thread of their own until they are stopped or their connection ends.
//
// Knobs make it a faulty phone instead. Every request is checked against what the daemon may
// send: a known service and message id, that message's exact body size and a known transaction
// id; one that breaks the rules is reported (on stderr unless a hook is set) and still answered.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "tools/sim/simulator.h"

namespace kestrel_sim {

enum class TestOutcome {
  kPassed,             // result 0, the sensor's words
  kFailedWithCode,     // result 1, error valid, error code 7
  kFailedWithoutCode,  // result 1, no error code
};

// What the phone gets wrong; the default is a healthy phone.
struct PhoneKnobs {
  bool failed_responses = false;  // every response carries result 1, error 3
  bool no_indications = false;    // tests and streams indicate nothing
  TestOutcome outcome = TestOutcome::kPassed;
};

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

  void set_knobs(const PhoneKnobs& knobs);
  // A stream start sends one sample at once, after its response, and no stream runs.
  void set_single_samples(bool single);
  // Called with a line about each request that breaks the rules, instead of printing it.
  void set_bad_request_hook(std::function<void(const std::string&)> hook);
  // Requests that broke the rules, over the phone's life.
  uint64_t bad_requests() const;

  // One row of the phone table: a kind of request (service, message id) with its body size, its
  // rule, its answer and its description. Null for a request the daemon never writes.
  struct MessageKind;
  static const MessageKind* message_kind(const Header& header);

 private:
  static const MessageKind kMessages[];

  // The answers of the phone table, one per kind of request.
  void answer_sensor_state(const Request& request, const PhoneKnobs& knobs);
  void answer_status(const Request& request, const PhoneKnobs& knobs);
  void answer_test(const Request& request, const PhoneKnobs& knobs);
  void answer_plain(const Request& request, const PhoneKnobs& knobs);
  void answer_report(const Request& request, const PhoneKnobs& knobs);
  void answer_daf(const Request& request, const PhoneKnobs& knobs);
  void respond(const Request& request, const std::vector<uint8_t>& body);
  void indicate_test(const Request& request, const PhoneKnobs& knobs, uint8_t sensor,
                     int32_t test_type, const std::vector<int32_t>& words);

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
  PhoneKnobs knobs_;
  bool single_samples_ = false;
  std::function<void(const std::string&)> bad_request_hook_;
  uint64_t bad_requests_ = 0;

  void check(const Request& request);
  PhoneKnobs knobs() const;
};

// One readable line about a request, e.g.
// "svc 0 msg 13 txn 4 size 12: self test SensorID 0 TestType 6".
std::string describe_request(const Request& request);

}  // namespace kestrel_sim
