// SPDX-License-Identifier: Apache-2.0
#include "tools/sim/healthy_phone.h"

#include <stdarg.h>
#include <stdio.h>

#include <algorithm>
#include <climits>

#include "kernel_frame.h"
#include "sensor1_messages.h"
#include "tools/sim/phone_bodies.h"

namespace kestrel_sim {

namespace {

using Clock = std::chrono::steady_clock;
using Body = std::vector<uint8_t>;

constexpr int kMaxRateHz = 1000;
constexpr int kDefaultRateHz = 10;
constexpr int kLightPollingHz = 10;
constexpr size_t kStatusResponseSize = 3;

// Q16 fixed point, as the sensor manager reports samples.
constexpr int32_t q16(double v) {
  return static_cast<int32_t>(v * 65536.0);
}

// Small deterministic noise in [-amplitude, amplitude], different per tick and axis.
int32_t noise(uint32_t tick, uint32_t axis, int32_t amplitude) {
  uint32_t h = tick * 2654435761u ^ (axis + 1) * 40503u;
  h ^= h >> 13;
  h *= 0x5bd1e995u;
  h ^= h >> 15;
  return static_cast<int32_t>(h % static_cast<uint32_t>(2 * amplitude + 1)) - amplitude;
}

std::string format(const char* fmt, ...) __attribute__((format(printf, 1, 2)));
std::string format(const char* fmt, ...) {
  char text[160];
  va_list args;
  va_start(args, fmt);
  vsnprintf(text, sizeof text, fmt, args);
  va_end(args);
  return text;
}

// Result words of a passed test, by sensor and test type; the first row that matches wins. A
// sensor the sensor manager does not have matches no row (no indication).
constexpr int32_t kAnyTest = INT32_MIN;
enum class Options { kAny, kCalibration };  // calibrations carry the option bytes 1, 1, 1, 1
struct TestWords {
  uint8_t sensor;
  int32_t test_type;
  Options options;
  std::vector<int32_t> words;
};
const TestWords kTestWords[] = {
    // Pass; output with self test off in mg (gravity on z); self-test status and the self-test
    // deltas in mg.
    {kSmgrAccel, kTestTypeSelftest, Options::kAny, {1, 12, -8, 1003, 1, 310, -295, 380}},
    {kSmgrAccel, kTestTypeLpfOn, Options::kAny, {11, 1}},             // low-pass filter on
    {kSmgrAccel, kTestTypeLpfOff, Options::kAny, {12, 0}},            // low-pass filter off
    {kSmgrAccel, kAnyTest, Options::kCalibration, {1, 23, -41, 12}},  // offsets in mg
    {kSmgrAccel, kAnyTest, Options::kAny, {1}},
    // Self test, pass, zero-rate offsets in milli-dps x 1000, pass again, the outputs with self
    // test off and on.
    {kSmgrGyro,
     kTestTypeSelftest,
     Options::kAny,
     {1, 1, 1250, -830, 410, 1, 12, -9, 5, 412, -391, 437}},
    {kSmgrGyro, kTestTypeGyroTemperature, Options::kAny, {2, q16(27.5)}},  // temperature, degC
    {kSmgrGyro, kAnyTest, Options::kAny, {3, 1, 1250, -830, 410}},         // calibration: zero rate
    // Pass, no error, the self-test field per axis and the raw readings behind it.
    {kSmgrMag, kTestTypeSelftest, Options::kAny, {1, 0, -30, 20, -700, 35, -42, 180, 1, 1}},
    {kSmgrMag, kTestTypeFuseRom, Options::kAny, {2, -3, 1}},  // sensitivity adjustment
    // WIA1, WIA2, ST1, HXL, HXH, HYL, HYH, HZL, HZH, TMPS, ST2, CNTL2, CNTL3, TS1.
    {kSmgrMag,
     kTestTypeRegisters,
     Options::kAny,
     {0x48, 0x09, 0x01, 0x2C, 0x00, 0xE4, 0xFF, 0x8A, 0xFE, 0x00, 0x18, 0x08, 0x00, 0x00}},
    {kSmgrMag, kAnyTest, Options::kCalibration, {1, 14, -6, 9}},  // hard-iron offsets
    {kSmgrMag, kAnyTest, Options::kAny, {1}},
    {kSmgrPressure, kAnyTest, Options::kAny, {1, 101325}},  // pass, Pa
    {kSmgrLight, kAnyTest, Options::kAny, {}},
    {kSmgrId60, kAnyTest, Options::kAny, {}},
};

bool is_calibration(const single_sensor_test_request& r) {
  return std::all_of(std::begin(r.option), std::end(r.option), [](uint8_t o) { return o == 1; });
}

const TestWords* test_words(uint8_t sensor, int32_t test_type, bool calibration) {
  for (const TestWords& row : kTestWords) {
    if (row.sensor == sensor && (row.test_type == kAnyTest || row.test_type == test_type) &&
        (row.options == Options::kAny || calibration)) {
      return &row;
    }
  }
  return nullptr;
}

struct TestName {
  int32_t test_type;
  const char* name;
};
const TestName kTestNames[] = {
    {kTestTypeOther, "test"},
    {kTestTypeSelftest, "self test"},
    {kTestTypeFuseRom, "fuse ROM read"},
    {kTestTypeRegisters, "register read"},
    {kTestTypeLpfOn, "low-pass filter on"},
    {kTestTypeLpfOff, "low-pass filter off"},
    {kTestTypeGyroTemperature, "temperature"},
};

const char* test_name(int32_t test_type, bool calibration) {
  if (calibration) return "calibration";
  for (const TestName& row : kTestNames) {
    if (row.test_type == test_type) return row.name;
  }
  return "test";
}

// The driver requests by daf_request_id: the first row whose range holds the id.
enum class DafAction { kNone, kStartPolling, kStopPolling, kRegisterDump };
struct DafKind {
  uint32_t first;
  uint32_t last;
  const char* name;
  DafAction action;
  uint8_t code;               // indication code of the polling started or stopped
  daf_thresholds thresholds;  // words of the response
};
// The bulk-data ids the driver answers with threshold words, as the daemon's family table has them.
constexpr uint32_t kDafThresholdFirst = bigdata_request_id_bound(FRAME_THRESHOLD, false);
constexpr uint32_t kDafThresholdLast = bigdata_request_id_bound(FRAME_THRESHOLD, true);
constexpr uint32_t kDafHdThresholdFirst = bigdata_request_id_bound(FRAME_HD_THRESHOLD, false);
constexpr uint32_t kDafHdThresholdLast = bigdata_request_id_bound(FRAME_HD_THRESHOLD, true);

const DafKind kDafKinds[] = {
    {kDafLightStreamStart,
     kDafLightStreamStart,
     "light polling start",
     DafAction::kStartPolling,
     kDafIndAlsRgb,
     {}},
    {kDafLightStreamStop,
     kDafLightStreamStop,
     "light polling stop",
     DafAction::kStopPolling,
     kDafIndAlsRgb,
     {}},
    {kDafLightShortStart,
     kDafLightShortStart,
     "short light polling start",
     DafAction::kStartPolling,
     kDafIndShort,
     {}},
    {kDafLightShortStop,
     kDafLightShortStop,
     "short light polling stop",
     DafAction::kStopPolling,
     kDafIndShort,
     {}},
    {kDafMotorEnabled, kDafMotorEnabled, "motor enabled", DafAction::kNone, 0, {}},
    {kDafMotorDisabled, kDafMotorDisabled, "motor disabled", DafAction::kNone, 0, {}},
    {kDafRegisterDump, kDafRegisterDump, "register dump", DafAction::kRegisterDump, 0, {}},
    {kDafHiddenHole, kDafHiddenHole, "hidden-hole coefficients", DafAction::kNone, 0, {}},
    {kDafThresholdFirst, kDafThresholdLast, "thresholds", DafAction::kNone, 0, {2600, 1800, 0, 0}},
    {kDafHdThresholdFirst,
     kDafHdThresholdLast,
     "hidden-hole thresholds",
     DafAction::kNone,
     0,
     {0, 0, 3100, 2300}},
    {kDafBigdataFirst, kDafHiddenHole - 1, "bulk data", DafAction::kNone, 0, {}},
};
const DafKind kOtherDaf = {0, UINT32_MAX, "driver request", DafAction::kNone, 0, {}};

const DafKind& daf_kind(uint32_t id) {
  for (const DafKind& row : kDafKinds) {
    if (id >= row.first && id <= row.last) return row;
  }
  return kOtherDaf;
}

// The rules of each request beyond its size: its transaction id and the fixed bytes.
bool report_rule(const Request& req) {
  return req.header.txn_id == kTxnReport;
}

bool status_rule(const Request& req) {
  return req.header.txn_id == kTxnStatus;
}

bool test_rule(const Request& req) {
  return req.header.txn_id == kTxnSingleSensorTest &&
         record_of<single_sensor_test_request>(req.body).data_type == 0;
}

bool cal_reset_rule(const Request& req) {
  return req.header.txn_id == kTxnCalReset;
}

bool sensor_state_rule(const Request& req) {
  return req.header.txn_id == kTxnSensorState &&
         record_of<sensor_state_request>(req.body).magic == kSensorStateMagic;
}

bool daf_rule(const Request& req) {
  const unsigned txn = req.header.txn_id;
  const daf_request r = record_of<daf_request>(req.body);
  return (txn == kTxnMotor || txn == kTxnDaf ||
          (txn >= kTxnThreshold && txn <= kTxnRegisterDumpLast)) &&
         r.flag == 1 && r.trailing_flag == 0 && r.data_length <= kDafDataMax;
}

// What each request says, for the program's trace.
std::string describe_sensor_state(const Body&) {
  return "sensor states";
}

std::string describe_status(const Body& b) {
  return format("status SensorID %u", record_of<status_request>(b).sensor_id);
}

std::string describe_cal_reset(const Body& b) {
  return format("calibration reset SensorID %u", record_of<cal_reset_request>(b).sensor_id);
}

std::string describe_test(const Body& b) {
  const auto r = record_of<single_sensor_test_request>(b);
  const int32_t test_type = static_cast<int32_t>(r.test_type);
  return format("%s SensorID %u TestType %d", test_name(test_type, is_calibration(r)), r.sensor_id,
                test_type);
}

std::string describe_report(const Body& b) {
  const auto r = record_of<report_request>(b);
  if (r.action != kReportActionAdd) return format("report %u stop", r.report_id);
  return format("report %u start SensorID %u at %u Hz", r.report_id, r.item_sensor_id,
                r.report_rate);
}

std::string describe_daf(const Body& b) {
  const uint32_t id = record_of<daf_request>(b).daf_request_id;
  return format("%s (daf %u)", daf_kind(id).name, id);
}

}  // namespace

struct HealthyPhone::MessageKind {
  uint32_t service;
  int32_t msg_id;
  size_t size;  // of the body, exactly
  bool (*rule)(const Request&);
  void (HealthyPhone::*answer)(const Request&, const PhoneKnobs&);
  std::string (*describe)(const Body&);
};

const HealthyPhone::MessageKind HealthyPhone::kMessages[] = {
    {kServiceSmgr, kMsgSmgrReport, sizeof(report_request), report_rule,
     &HealthyPhone::answer_report, describe_report},
    {kServiceSmgr, kMsgSmgrStatus, sizeof(status_request), status_rule,
     &HealthyPhone::answer_status, describe_status},
    {kServiceSmgr, kMsgSmgrSingleSensorTest, sizeof(single_sensor_test_request), test_rule,
     &HealthyPhone::answer_test, describe_test},
    {kServiceSmgr, kMsgSmgrCalReset, sizeof(cal_reset_request), cal_reset_rule,
     &HealthyPhone::answer_plain, describe_cal_reset},
    {kServiceSmgr, kMsgSmgrSensorState, sizeof(sensor_state_request), sensor_state_rule,
     &HealthyPhone::answer_sensor_state, describe_sensor_state},
    {kServiceDaf, kMsgDafRequest, sizeof(daf_request), daf_rule, &HealthyPhone::answer_daf,
     describe_daf},
};

const HealthyPhone::MessageKind* HealthyPhone::message_kind(const Header& header) {
  for (const MessageKind& kind : kMessages) {
    if (kind.service == header.service && kind.msg_id == header.msg_id) return &kind;
  }
  return nullptr;
}

namespace {

// The rules of the requests the daemon writes: a kind the table knows, its exact size and the
// kind's own rule.
bool follows_rules(const Request& req) {
  const HealthyPhone::MessageKind* kind = HealthyPhone::message_kind(req.header);
  return req.body.size() == req.header.msg_size && kind != nullptr &&
         req.body.size() == kind->size && kind->rule(req);
}

}  // namespace

HealthyPhone::HealthyPhone(Simulator& sim) : sim_(sim) {}

void HealthyPhone::set_knobs(const PhoneKnobs& knobs) {
  std::lock_guard<std::mutex> lock(mu_);
  knobs_ = knobs;
}

PhoneKnobs HealthyPhone::knobs() const {
  std::lock_guard<std::mutex> lock(mu_);
  return knobs_;
}

void HealthyPhone::set_single_samples(bool single) {
  std::lock_guard<std::mutex> lock(mu_);
  single_samples_ = single;
}

void HealthyPhone::set_bad_request_hook(std::function<void(const std::string&)> hook) {
  std::lock_guard<std::mutex> lock(mu_);
  bad_request_hook_ = std::move(hook);
}

uint64_t HealthyPhone::bad_requests() const {
  std::lock_guard<std::mutex> lock(mu_);
  return bad_requests_;
}

void HealthyPhone::check(const Request& req) {
  if (follows_rules(req)) return;
  std::function<void(const std::string&)> hook;
  {
    std::lock_guard<std::mutex> lock(mu_);
    ++bad_requests_;
    hook = bad_request_hook_;
  }
  const std::string line = "request breaks the rules: " + describe_request(req);
  if (hook) {
    hook(line);
  } else {
    fprintf(stderr, "kestrel-sim: %s\n", line.c_str());
  }
}

HealthyPhone::~HealthyPhone() {
  stop();
}

namespace {

common_response common_of(const PhoneKnobs& knobs) {
  return knobs.failed_responses ? common_response{1, 3} : common_response{0, 0};
}

}  // namespace

void HealthyPhone::answer(const Request& req) {
  check(req);
  const PhoneKnobs now = knobs();
  const MessageKind* kind = message_kind(req.header);
  if (kind != nullptr) {
    (this->*kind->answer)(req, now);
  } else {
    answer_plain(req, now);
  }
}

void HealthyPhone::respond(const Request& req, const std::vector<uint8_t>& body) {
  sim_.respond_to(req.connection, {req.header.service, req.header.msg_id, 0, req.header.txn_id},
                  body);
}

void HealthyPhone::indicate_test(const Request& req, const PhoneKnobs& knobs, uint8_t sensor,
                                 int32_t test_type, const std::vector<int32_t>& words) {
  if (knobs.no_indications) return;
  const bool failed = knobs.outcome != TestOutcome::kPassed;
  const bool with_code = knobs.outcome == TestOutcome::kFailedWithCode;
  sim_.indicate_to(
      req.connection, {kServiceSmgr, kMsgSmgrSingleSensorTest, 0, req.header.txn_id},
      test_indication_body(sensor, test_type, failed, with_code, with_code ? 7 : 0, words));
}

void HealthyPhone::answer_plain(const Request& req, const PhoneKnobs& knobs) {
  const common_response c = common_of(knobs);
  respond(req, common_response_body(c.result, c.error));
}

void HealthyPhone::answer_sensor_state(const Request& req, const PhoneKnobs& knobs) {
  respond(req, sensor_state_body(common_of(knobs)));
}

void HealthyPhone::answer_status(const Request& req, const PhoneKnobs& knobs) {
  const common_response c = common_of(knobs);
  respond(req, common_response_body(c.result, c.error, kStatusResponseSize));
  // A sensor that answers its status poll reports a finished test of type 3.
  const uint8_t id = record_of<status_request>(req.body).sensor_id;
  if (test_words(id, kTestTypeOther, false) != nullptr) {
    indicate_test(req, knobs, id, kTestTypeOther, {});
  }
}

void HealthyPhone::answer_test(const Request& req, const PhoneKnobs& knobs) {
  answer_plain(req, knobs);
  const auto r = record_of<single_sensor_test_request>(req.body);
  const int32_t test_type = static_cast<int32_t>(r.test_type);
  const TestWords* row = test_words(r.sensor_id, test_type, is_calibration(r));
  if (row != nullptr) indicate_test(req, knobs, r.sensor_id, test_type, row->words);
}

void HealthyPhone::answer_report(const Request& req, const PhoneKnobs& knobs) {
  const auto r = record_of<report_request>(req.body);
  const int conn = req.connection;
  uint8_t sensor = r.item_sensor_id;
  if (r.action == kReportActionAdd) {
    const int rate = std::min(r.report_rate == 0 ? kDefaultRateHz : int{r.report_rate}, kMaxRateHz);
    Stream s;
    s.connection = conn;
    s.service = kServiceSmgr;
    s.key = r.report_id;
    s.sensor = sensor;
    s.period = std::chrono::microseconds(1000000 / rate);
    // Samples follow the response that accepted the report.
    respond(req, report_response_body(common_of(knobs), sensor));
    if (!knobs.no_indications) start_stream(s);
    return;
  }
  if (r.action == kReportActionDelete) {
    // The delete request names only the report; the answer names its sensor.
    {
      std::lock_guard<std::mutex> lock(mu_);
      for (const Stream& s : streams_) {
        if (s.connection == conn && s.service == kServiceSmgr && s.key == r.report_id) {
          sensor = s.sensor;
        }
      }
    }
    stop_stream(conn, kServiceSmgr, r.report_id);
  }
  // A stopped stream sends nothing after this response.
  respond(req, report_response_body(common_of(knobs), sensor));
}

void HealthyPhone::answer_daf(const Request& req, const PhoneKnobs& knobs) {
  const DafKind& kind = daf_kind(record_of<daf_request>(req.body).daf_request_id);
  if (kind.action == DafAction::kStopPolling) stop_stream(req.connection, kServiceDaf, kind.code);
  respond(req, kind.action == DafAction::kRegisterDump
                   ? register_dump_body(common_of(knobs), req.header.txn_id)
                   : daf_thresholds_body(common_of(knobs), kind.thresholds));
  if (kind.action != DafAction::kStartPolling || knobs.no_indications) return;
  // The results follow the response.
  Stream s;
  s.connection = req.connection;
  s.service = kServiceDaf;
  s.key = kind.code;
  s.period = std::chrono::microseconds(1000000 / kLightPollingHz);
  start_stream(s);
}

void HealthyPhone::start_stream(const Stream& stream) {
  bool single;
  {
    std::lock_guard<std::mutex> lock(mu_);
    single = single_samples_;
  }
  if (single) {
    Stream once = stream;
    send_sample(once);
    return;
  }
  remove_streams([&](const Stream& s) {
    return s.connection == stream.connection && s.service == stream.service && s.key == stream.key;
  });
  std::lock_guard<std::mutex> lock(mu_);
  if (stopping_) return;
  streams_.push_back(stream);
  streams_.back().id = next_id_++;
  streams_.back().next = Clock::now() + stream.period;
  if (!thread_.joinable()) thread_ = std::thread([this] { run_streams(); });
  cv_.notify_all();
}

template <typename Match>
void HealthyPhone::remove_streams(Match match) {
  {
    std::lock_guard<std::mutex> lock(mu_);
    streams_.erase(std::remove_if(streams_.begin(), streams_.end(), match), streams_.end());
    cv_.notify_all();
  }
  // A sample of a removed stream may be on its way out: wait for it.
  std::lock_guard<std::mutex> sending(send_mu_);
}

void HealthyPhone::stop_stream(int connection, uint32_t service, uint32_t key) {
  remove_streams([&](const Stream& s) {
    return s.connection == connection && s.service == service && s.key == key;
  });
}

void HealthyPhone::stop_streams() {
  remove_streams([](const Stream&) { return true; });
}

void HealthyPhone::stop() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    stopping_ = true;
  }
  stop_streams();
  if (thread_.joinable()) thread_.join();
}

size_t HealthyPhone::stream_count() const {
  std::lock_guard<std::mutex> lock(mu_);
  return streams_.size();
}

bool HealthyPhone::send_sample(Stream& s) {
  const uint32_t t = s.tick;
  if (s.service == kServiceDaf) {
    const Header h{kServiceDaf, kMsgDafIndication, 0, 0};
    if (s.key == kDafIndAlsRgb) {
      // lux, red, green, blue, clear, infrared.
      return sim_.indicate_to(s.connection, h,
                              daf_indication_body(kDafIndAlsRgb, 1, 24,
                                                  {250 + noise(t, 0, 3), 1180 + noise(t, 1, 8),
                                                   1420 + noise(t, 2, 8), 760 + noise(t, 3, 8),
                                                   3350 + noise(t, 4, 15), 140 + noise(t, 5, 2)}));
    }
    return sim_.indicate_to(
        s.connection, h,
        daf_indication_body(kDafIndShort, 1, 8,
                            {250 + noise(t, 0, 3), 3350 + noise(t, 1, 15), 0, 0, 0, 0}));
  }
  int32_t x = 0, y = 0, z = 0;
  switch (s.sensor) {
    case kSmgrAccel:  // m/s^2: lying flat, gravity on z
      x = q16(0.1) + noise(t, 0, 1300);
      y = q16(-0.2) + noise(t, 1, 1300);
      z = q16(9.80665) + noise(t, 2, 1300);
      break;
    case kSmgrGyro:  // rad/s: still
      x = 40 + noise(t, 0, 30);
      y = -25 + noise(t, 1, 30);
      z = 15 + noise(t, 2, 30);
      break;
    case kSmgrMag:  // gauss: the earth's field, about 22, -5 and -42 uT
      x = q16(0.22) + noise(t, 0, 300);
      y = q16(-0.05) + noise(t, 1, 300);
      z = q16(-0.42) + noise(t, 2, 300);
      break;
    case kSmgrPressure:  // hPa and degC
      x = q16(1013.25) + noise(t, 0, 650);
      y = q16(27.5) + noise(t, 1, 650);
      break;
    case kSmgrLight:  // 250 lux, as the daemon reads this sensor (1 - x / 2^16)
      x = q16(1.0 - 250.0) + noise(t, 0, 65536 * 3);
      break;
    case kSmgrId60:
      x = q16(5.0) + noise(t, 0, 200);
      break;
    default:
      break;
  }
  return sim_.indicate_to(s.connection, {kServiceSmgr, kMsgSmgrSample, 0, 0},
                          sample_indication_body(s.sensor, 0, x, y, z));
}

void HealthyPhone::run_streams() {
  std::unique_lock<std::mutex> lock(mu_);
  while (!stopping_) {
    if (streams_.empty()) {
      cv_.wait(lock);
      continue;
    }
    const Clock::time_point now = Clock::now();
    Clock::time_point earliest = streams_.front().next;
    for (const Stream& s : streams_) earliest = std::min(earliest, s.next);
    if (now < earliest) {
      cv_.wait_until(lock, earliest);
      continue;
    }
    std::vector<uint64_t> due;
    for (Stream& s : streams_) {
      if (s.next > now) continue;
      due.push_back(s.id);
      s.next += s.period;
      if (s.next < now) s.next = now + s.period;  // a stalled reader gets no burst of backlog
    }
    lock.unlock();
    std::vector<uint64_t> dead;
    {
      std::lock_guard<std::mutex> sending(send_mu_);
      // Only streams still running once the send lock is held: a stop that came in between
      // has removed its stream and now waits for this lock.
      std::vector<Stream> batch;
      lock.lock();
      for (Stream& s : streams_) {
        if (std::find(due.begin(), due.end(), s.id) == due.end()) continue;
        batch.push_back(s);
        ++s.tick;
      }
      lock.unlock();
      for (Stream& s : batch) {
        if (!send_sample(s)) dead.push_back(s.id);
      }
    }
    lock.lock();
    // A stream whose connection has ended stops.
    streams_.erase(std::remove_if(streams_.begin(), streams_.end(),
                                  [&](const Stream& s) {
                                    return std::find(dead.begin(), dead.end(), s.id) != dead.end();
                                  }),
                   streams_.end());
  }
}

std::string describe_request(const Request& req) {
  const HealthyPhone::MessageKind* kind = HealthyPhone::message_kind(req.header);
  const std::string what = kind != nullptr ? kind->describe(req.body) : "unknown request";
  return format("svc %u msg %d txn %u size %zu: ", req.header.service, req.header.msg_id,
                req.header.txn_id, req.body.size()) +
         what;
}

}  // namespace kestrel_sim
