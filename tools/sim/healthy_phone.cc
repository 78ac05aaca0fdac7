#include "tools/sim/healthy_phone.h"

#include <stdio.h>

#include <algorithm>
#include <optional>

#include "byte_order.h"
#include "sensor1_messages.h"

namespace kestrel_sim {

namespace {

using Clock = std::chrono::steady_clock;

// Size of every daf_response: result, error, then room for the threshold words and for the 128
// register bytes of a dump at 12..139.
constexpr size_t kDafResponseSize = 140;
constexpr size_t kSensorStateResponseSize = 4 + kStateRecordSize * kStateRecordCount;
constexpr size_t kReportResponseSize = 12;
constexpr int kMaxRateHz = 1000;
constexpr int kDefaultRateHz = 10;
constexpr int kLightPollingHz = 10;

// Q16 fixed point, as the sensor manager reports samples.
constexpr int32_t q16(double v) {
  return static_cast<int32_t>(v * 65536.0);
}

uint8_t byte_at(const std::vector<uint8_t>& b, size_t offset) {
  return offset < b.size() ? b[offset] : 0;
}

uint32_t u32_at(const std::vector<uint8_t>& b, size_t offset) {
  return offset + 4 <= b.size() ? load_u32(b.data(), offset) : 0;
}

uint16_t u16_at(const std::vector<uint8_t>& b, size_t offset) {
  return offset + 2 <= b.size() ? load_u16(b.data(), offset) : 0;
}

// Small deterministic noise in [-amplitude, amplitude], different per tick and axis.
int32_t noise(uint32_t tick, uint32_t axis, int32_t amplitude) {
  uint32_t h = tick * 2654435761u ^ (axis + 1) * 40503u;
  h ^= h >> 13;
  h *= 0x5bd1e995u;
  h ^= h >> 15;
  return static_cast<int32_t>(h % static_cast<uint32_t>(2 * amplitude + 1)) - amplitude;
}

bool known_test_sensor(uint8_t id) {
  return id == kSmgrAccel || id == kSmgrGyro || id == kSmgrMag || id == kSmgrPressure ||
         id == kSmgrLight || id == kSmgrId60;
}

// Result words of a passed test, by sensor and test type; nullopt when the sensor manager has no
// such sensor (no indication). Calibrations carry the option bytes 1, 1, 1, 1.
std::optional<std::vector<int32_t>> test_words(uint8_t sensor, int32_t test_type,
                                               bool calibration) {
  switch (sensor) {
    case kSmgrAccel:
      if (test_type == 6) {
        // Pass; output with self test off in mg (gravity on z); self-test status and the
        // self-test deltas in mg.
        return std::vector<int32_t>{1, 12, -8, 1003, 1, 310, -295, 380};
      }
      if (test_type == 11) return std::vector<int32_t>{11, 1};       // low-pass filter on
      if (test_type == 12) return std::vector<int32_t>{12, 0};       // low-pass filter off
      if (calibration) return std::vector<int32_t>{1, 23, -41, 12};  // offsets in mg
      return std::vector<int32_t>{1};
    case kSmgrGyro:
      if (test_type == 6) {
        // Self test, pass, zero-rate offsets in milli-dps x 1000, pass again, the outputs with
        // self test off and on.
        return std::vector<int32_t>{1, 1, 1250, -830, 410, 1, 12, -9, 5, 412, -391, 437};
      }
      if (test_type == 13) return std::vector<int32_t>{2, q16(27.5)};  // temperature, degC
      return std::vector<int32_t>{3, 1, 1250, -830, 410};  // calibration: zero-rate offsets
    case kSmgrMag:
      if (test_type == 6) {
        // Pass, no error, the self-test field per axis and the raw readings behind it.
        return std::vector<int32_t>{1, 0, -30, 20, -700, 35, -42, 180, 1, 1};
      }
      if (test_type == 9) return std::vector<int32_t>{2, -3, 1};  // sensitivity adjustment
      if (test_type == 10) {
        // WIA1, WIA2, ST1, HXL, HXH, HYL, HYH, HZL, HZH, TMPS, ST2, CNTL2, CNTL3, TS1.
        return std::vector<int32_t>{0x48, 0x09, 0x01, 0x2C, 0x00, 0xE4, 0xFF,
                                    0x8A, 0xFE, 0x00, 0x18, 0x08, 0x00, 0x00};
      }
      if (calibration) return std::vector<int32_t>{1, 14, -6, 9};  // hard-iron offsets
      return std::vector<int32_t>{1};
    case kSmgrPressure:
      return std::vector<int32_t>{1, 101325};  // pass, Pa
    case kSmgrLight:
    case kSmgrId60:
      return std::vector<int32_t>{};
    default:
      return std::nullopt;
  }
}

// 128 register bytes of a dump, by the txn_id that names the sensor.
std::vector<uint8_t> register_dump(uint8_t txn) {
  std::vector<uint8_t> r(128, 0);
  switch (txn) {
    case kTxnRegisterDumpFirst:      // accelerometer (LSM6DSM)
    case kTxnRegisterDumpFirst + 1:  // gyroscope, same chip
      r[0x0F] = 0x6A;                // WHO_AM_I
      r[0x10] = 0x4C;                // CTRL1_XL: 104 Hz, 8 g
      r[0x11] = 0x4C;                // CTRL2_G: 104 Hz, 2000 dps
      r[0x12] = 0x44;                // CTRL3_C: BDU, IF_INC
      r[0x1E] = 0x07;                // STATUS: data ready
      r[0x20] = 0xE0;                // OUT_TEMP
      r[0x21] = 0x04;
      r[0x22] = 0x03;  // gyroscope x, y, z: close to zero
      r[0x24] = 0xFE;
      r[0x25] = 0xFF;
      r[0x26] = 0x01;
      r[0x28] = 0x0C;  // accelerometer x, y, z: gravity on z
      r[0x2A] = 0xF8;
      r[0x2B] = 0xFF;
      r[0x2D] = 0x10;
      break;
    case kTxnRegisterDumpFirst + 2:  // magnetometer (AK09916C)
      r[0x00] = 0x48;                // WIA1
      r[0x01] = 0x09;                // WIA2
      r[0x10] = 0x01;                // ST1
      r[0x11] = 0x2C;                // HXL, HXH, HYL, HYH, HZL, HZH
      r[0x13] = 0xE4;
      r[0x14] = 0xFF;
      r[0x15] = 0x8A;
      r[0x16] = 0xFE;
      r[0x18] = 0x18;  // ST2
      r[0x31] = 0x08;  // CNTL2: continuous, 100 Hz
      break;
    case kTxnRegisterDumpFirst + 3:  // pressure sensor (LPS22HB)
      r[0x0F] = 0xB1;                // WHO_AM_I
      r[0x10] = 0x30;                // CTRL_REG1: 25 Hz
      r[0x11] = 0x10;                // CTRL_REG2: IF_ADD_INC
      r[0x27] = 0x03;                // STATUS
      r[0x28] = 0x00;                // 1013.25 hPa x 4096
      r[0x29] = 0x54;
      r[0x2A] = 0x3F;
      r[0x2B] = 0xBE;  // 27.50 degC x 100
      r[0x2C] = 0x0A;
      break;
    case kTxnRegisterDumpFirst + 4:  // light sensor, registers 0x80 to 0xff
    case kTxnRegisterDumpLast:
      r[0x00] = 0x03;  // ENABLE: power on, ALS
      r[0x01] = 0xF6;  // ATIME
      r[0x0F] = 0x01;  // CONTROL: gain 4x
      r[0x12] = 0xE0;  // ID
      r[0x13] = 0x11;  // STATUS
      r[0x14] = 0x16;  // clear, red, green, blue channels
      r[0x15] = 0x0D;
      r[0x16] = 0x9C;
      r[0x17] = 0x04;
      r[0x18] = 0x8C;
      r[0x19] = 0x05;
      r[0x1A] = 0xF8;
      r[0x1B] = 0x02;
      break;
    default:
      break;
  }
  return r;
}

void fill_sensor_state_table(std::vector<uint8_t>* table) {
  uint8_t* b = table->data();
  const uint8_t ids[] = {kSmgrAccel, kSmgrGyro, kSmgrMag, kSmgrPressure, kSmgrLight, kSmgrId60};
  for (size_t i = 0; i < kStateRecordCount; ++i) {
    uint8_t* rec = b + kStateRecordsOffset + i * kStateRecordSize;
    if (i >= sizeof ids) {
      rec[0] = 255;  // empty
      continue;
    }
    rec[0] = ids[i];
    rec[1] = 0x01;   // online
    rec[2] = 0x00;   // no error
    rec[3] = 0x0A;   // reports: one per sensor line
    rec[4] = 0x64;   // highest rate, Hz
    rec[12] = 0x01;  // powered
    rec[13] = 0x00;  // no fault
  }
}

// The rules of the requests the daemon writes: each message's exact size and its txn ids.
bool follows_rules(const Request& req) {
  const std::vector<uint8_t>& b = req.body;
  const size_t size = b.size();
  const unsigned txn = req.header.txn_id;
  if (size != req.header.msg_size) return false;
  if (req.header.service == kServiceSmgr) {
    switch (req.header.msg_id) {
      case kMsgSmgrReport:
        return size == kReportRequestSize && txn == kTxnReport;
      case kMsgSmgrStatus:
        return size == 3 && txn == kTxnStatus;
      case kMsgSmgrSingleSensorTest:
        return size == sizeof(single_sensor_test_request) && txn == kTxnSingleSensorTest &&
               b[1] == 0;
      case kMsgSmgrCalReset:
        return size == 3 && txn == kTxnSingleSensorTest;
      case kMsgSmgrSensorState:
        return size == 1 && txn == kTxnSensorState && b[0] == 0xAA;
      default:
        return false;
    }
  }
  return req.header.service == kServiceDaf && req.header.msg_id == kMsgDafRequest &&
         size == sizeof(daf_request) &&
         (txn == kTxnMotor || txn == kTxnDaf ||
          (txn >= kTxnThreshold && txn <= kTxnRegisterDumpLast)) &&
         b[offsetof(daf_request, flag)] == 1 && b[offsetof(daf_request, trailing_flag)] == 0 &&
         load_u32(b.data(), offsetof(daf_request, data_length)) <= kDafDataMax;
}

const char* test_name(int32_t test_type, bool calibration) {
  if (calibration) return "calibration";
  switch (test_type) {
    case 3:
      return "test";
    case 6:
      return "self test";
    case 9:
      return "fuse ROM read";
    case 10:
      return "register read";
    case 11:
      return "low-pass filter on";
    case 12:
      return "low-pass filter off";
    case 13:
      return "temperature";
    default:
      return "test";
  }
}

const char* daf_name(uint32_t id) {
  switch (id) {
    case kDafLightStreamStart:
      return "light polling start";
    case kDafLightStreamStop:
      return "light polling stop";
    case kDafLightShortStart:
      return "short light polling start";
    case kDafLightShortStop:
      return "short light polling stop";
    case kDafMotorEnabled:
      return "motor enabled";
    case kDafMotorDisabled:
      return "motor disabled";
    case kDafRegisterDump:
      return "register dump";
    case kDafHiddenHole:
      return "hidden-hole coefficients";
    case 100006:
    case 100007:
      return "thresholds";
    case 100008:
    case 100009:
      return "hidden-hole thresholds";
    default:
      return id >= kDafBigdataFirst && id < kDafHiddenHole ? "bulk data" : "driver request";
  }
}

bool is_calibration(const std::vector<uint8_t>& body) {
  return byte_at(body, 8) == 1 && byte_at(body, 9) == 1 && byte_at(body, 10) == 1 &&
         byte_at(body, 11) == 1;
}

}  // namespace

HealthyPhone::HealthyPhone(Simulator& sim) : sim_(sim) {}

void HealthyPhone::set_knobs(const PhoneKnobs& knobs) {
  std::lock_guard<std::mutex> lock(mu_);
  knobs_ = knobs;
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

std::vector<uint8_t> HealthyPhone::response(size_t size) const {
  std::lock_guard<std::mutex> lock(mu_);
  return knobs_.failed_responses ? common_response_body(1, 3, size)
                                 : common_response_body(0, 0, size);
}

HealthyPhone::~HealthyPhone() {
  stop();
}

void HealthyPhone::answer(const Request& req) {
  check(req);
  PhoneKnobs knobs;
  {
    std::lock_guard<std::mutex> lock(mu_);
    knobs = knobs_;
  }
  const bool failed = knobs.outcome != TestOutcome::kPassed;
  const bool with_code = knobs.outcome == TestOutcome::kFailedWithCode;
  const std::vector<uint8_t>& body = req.body;
  const Header resp{req.header.service, req.header.msg_id, 0, req.header.txn_id};
  const int conn = req.connection;

  if (req.header.service == kServiceSmgr) {
    switch (req.header.msg_id) {
      case kMsgSmgrSensorState: {
        std::vector<uint8_t> table = response(kSensorStateResponseSize);
        fill_sensor_state_table(&table);
        sim_.respond_to(conn, resp, table);
        return;
      }
      case kMsgSmgrStatus: {
        sim_.respond_to(conn, resp, response(3));
        const uint8_t id = byte_at(body, 0);
        // A sensor that answers its status poll reports a finished test of type 3.
        if (known_test_sensor(id) && !knobs.no_indications) {
          sim_.indicate_to(conn, {kServiceSmgr, kMsgSmgrSingleSensorTest, 0, req.header.txn_id},
                           test_indication_body(id, 3, failed, with_code, with_code ? 7 : 0, {}));
        }
        return;
      }
      case kMsgSmgrSingleSensorTest: {
        sim_.respond_to(conn, resp, response(2));
        const uint8_t id = byte_at(body, 0);
        const int32_t test_type = static_cast<int32_t>(u32_at(body, 4));
        const auto words = test_words(id, test_type, is_calibration(body));
        if (words && !knobs.no_indications) {
          sim_.indicate_to(
              conn, {kServiceSmgr, kMsgSmgrSingleSensorTest, 0, req.header.txn_id},
              test_indication_body(id, test_type, failed, with_code, with_code ? 7 : 0, *words));
        }
        return;
      }
      case kMsgSmgrReport: {
        const uint8_t report_id = byte_at(body, kReportIdOffset);
        const uint8_t action = byte_at(body, kReportActionOffset);
        uint8_t sensor = byte_at(body, kReportItemOffset);
        if (action == kReportActionAdd) {
          int rate = u16_at(body, kReportRateOffset);
          if (rate <= 0) rate = kDefaultRateHz;
          rate = std::min(rate, kMaxRateHz);
          Stream s;
          s.connection = conn;
          s.service = kServiceSmgr;
          s.key = report_id;
          s.sensor = sensor;
          s.period = std::chrono::microseconds(1000000 / rate);
          // Samples follow the response that accepted the report.
          std::vector<uint8_t> r = response(kReportResponseSize);
          r[kReportRespSensorIdOffset] = sensor;
          sim_.respond_to(conn, resp, r);
          if (!knobs.no_indications) start_stream(s);
          return;
        } else if (action == kReportActionDelete) {
          // The delete request names only the report; the answer names its sensor.
          {
            std::lock_guard<std::mutex> lock(mu_);
            for (const Stream& s : streams_) {
              if (s.connection == conn && s.service == kServiceSmgr && s.key == report_id) {
                sensor = s.sensor;
              }
            }
          }
          stop_stream(conn, kServiceSmgr, report_id);
        }
        // A stopped stream sends nothing after this response.
        std::vector<uint8_t> r = response(kReportResponseSize);
        r[kReportRespSensorIdOffset] = sensor;
        sim_.respond_to(conn, resp, r);
        return;
      }
      default:
        break;
    }
  } else if (req.header.service == kServiceDaf && req.header.msg_id == kMsgDafRequest) {
    const uint32_t id = u32_at(body, offsetof(daf_request, daf_request_id));
    std::vector<uint8_t> r = response(kDafResponseSize);
    Stream s;
    s.connection = conn;
    s.service = kServiceDaf;
    s.period = std::chrono::microseconds(1000000 / kLightPollingHz);
    switch (id) {
      case kDafLightStreamStart:
        s.key = kDafIndAlsRgb;
        break;
      case kDafLightStreamStop:
        stop_stream(conn, kServiceDaf, kDafIndAlsRgb);
        break;
      case kDafLightShortStart:
        s.key = kDafIndShort;
        break;
      case kDafLightShortStop:
        stop_stream(conn, kServiceDaf, kDafIndShort);
        break;
      case kDafRegisterDump: {
        const std::vector<uint8_t> regs = register_dump(req.header.txn_id);
        std::copy(regs.begin(), regs.end(), r.begin() + kDafRespRegistersOffset);
        break;
      }
      case 100006:
      case 100007:
        store_i32(r.data(), kDafRespHighOffset, 2600);
        store_i32(r.data(), kDafRespLowOffset, 1800);
        break;
      case 100008:
      case 100009:
        store_i32(r.data(), kDafRespHdHighOffset, 3100);
        store_i32(r.data(), kDafRespHdLowOffset, 2300);
        break;
      default:
        break;
    }
    sim_.respond_to(conn, resp, r);
    if (s.key != 0 && !knobs.no_indications) start_stream(s);  // results follow the response
    return;
  }
  sim_.respond_to(conn, resp, response(2));
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
  const std::vector<uint8_t>& b = req.body;
  char what[160] = "";
  if (req.header.service == kServiceSmgr) {
    switch (req.header.msg_id) {
      case kMsgSmgrSensorState:
        snprintf(what, sizeof what, "sensor states");
        break;
      case kMsgSmgrStatus:
        snprintf(what, sizeof what, "status SensorID %u", byte_at(b, 0));
        break;
      case kMsgSmgrCalReset:
        snprintf(what, sizeof what, "calibration reset SensorID %u", byte_at(b, 1));
        break;
      case kMsgSmgrSingleSensorTest: {
        const int32_t test_type = static_cast<int32_t>(u32_at(b, 4));
        snprintf(what, sizeof what, "%s SensorID %u TestType %d",
                 test_name(test_type, is_calibration(b)), byte_at(b, 0), test_type);
        break;
      }
      case kMsgSmgrReport:
        if (byte_at(b, kReportActionOffset) == kReportActionAdd) {
          snprintf(what, sizeof what, "report %u start SensorID %u at %u Hz",
                   byte_at(b, kReportIdOffset), byte_at(b, kReportItemOffset),
                   u16_at(b, kReportRateOffset));
        } else {
          snprintf(what, sizeof what, "report %u stop", byte_at(b, kReportIdOffset));
        }
        break;
      default:
        snprintf(what, sizeof what, "unknown request");
        break;
    }
  } else if (req.header.service == kServiceDaf && req.header.msg_id == kMsgDafRequest) {
    const uint32_t id = u32_at(b, offsetof(daf_request, daf_request_id));
    snprintf(what, sizeof what, "%s (daf %u)", daf_name(id), id);
  } else {
    snprintf(what, sizeof what, "unknown request");
  }
  char line[256];
  snprintf(line, sizeof line, "svc %u msg %d txn %u size %zu: %s", req.header.service,
           req.header.msg_id, req.header.txn_id, b.size(), what);
  return line;
}

}  // namespace kestrel_sim
