// SPDX-License-Identifier: Apache-2.0
#include "frame_decoder.h"

#include <stdio.h>
#include <stdlib.h>

#include "byte_order.h"
#include "kernel_frame.h"
#include "kernel_sensors.h"
#include "sensor_names.h"

namespace kestrelctl {
namespace {

constexpr size_t kTextNameWidth = 18;

std::string printf_string(const char* format, double a, double b, double c) {
  char buf[128];
  snprintf(buf, sizeof buf, format, a, b, c);
  return buf;
}

std::string with_note(int64_t value, const std::string& note) {
  return note.empty() ? std::to_string(value) : std::to_string(value) + " (" + note + ")";
}

Field number(const std::string& name, int64_t value, const std::string& note = "") {
  return Field{name, std::to_string(value), with_note(value, note)};
}

Field json_only(const std::string& name, const std::string& json) {
  Field f{name, json, ""};
  f.in_text = false;
  return f;
}

Field text_only(const std::string& name, const std::string& text) {
  Field f{name, "", text};
  f.in_json = false;
  return f;
}

std::string json_array(const std::vector<int64_t>& values) {
  std::string s = "[";
  for (size_t i = 0; i < values.size(); ++i) {
    if (i > 0) s += ",";
    s += std::to_string(values[i]);
  }
  return s + "]";
}

std::string joined(const std::vector<int64_t>& values) {
  std::string s;
  for (size_t i = 0; i < values.size(); ++i) {
    if (i > 0) s += " ";
    s += std::to_string(values[i]);
  }
  return s;
}

int32_t word(const Frame& f, size_t index) {
  return load_i32(f.payload.data(), 4 * index);
}

std::string verdict(bool pass) {
  return pass ? "PASS" : "FAIL";
}

// The kernel sensor code of a reply, with its name in text and a "sensor" name in JSON.
void add_code(DecodedFrame* d, const std::string& name, int32_t code) {
  d->fields.push_back(number(name, code, sensor_code_name(code)));
  d->fields.push_back(json_only("sensor", json_string(sensor_code_name(code))));
}

void add_sensor_type(DecodedFrame* d, const std::string& name, int32_t sensor_type) {
  d->fields.push_back(number(name, sensor_type, sensor_type_name(sensor_type)));
  d->fields.push_back(json_only("sensor", json_string(sensor_type_name(sensor_type))));
}

void decode_status(const Frame& f, DecodedFrame* d) {
  add_sensor_type(d, "sensor_type", load_u8(f.payload.data(), 0));
  const uint8_t no_response = load_u8(f.payload.data(), 1);
  const char* note = no_response == 0   ? "the sensor answered"
                     : no_response == 1 ? "no answer within the daemon's wait"
                                        : "";
  d->fields.push_back(number("no_response", no_response, note));
}

void decode_sample(const Frame& f, DecodedFrame* d) {
  const int32_t code = word(f, 0);
  std::vector<int64_t> values;
  for (size_t i = 0; i < 6; ++i) {
    values.push_back(static_cast<int16_t>(load_u16(f.payload.data(), 4 + 2 * i)));
  }
  add_code(d, "code", code);
  const SampleScale scale = sample_scale(code);
  std::string text;
  if (code == SENSOR_CODE_ACCEL || code == SENSOR_CODE_GYRO || code == SENSOR_CODE_MAG) {
    text = "x=" + std::to_string(values[0]) + " y=" + std::to_string(values[1]) +
           " z=" + std::to_string(values[2]) +
           printf_string(code == SENSOR_CODE_ACCEL ? " (%.3f %.3f %.3f " : " (%.2f %.2f %.2f ",
                         values[0] * scale.per_count, values[1] * scale.per_count,
                         values[2] * scale.per_count) +
           scale.unit + ")";
  } else {
    text = joined(std::vector<int64_t>(values.begin(), values.begin() + scale.axes));
  }
  d->fields.push_back(Field{"values", json_array(values), text});
  d->one_line = true;
}

void decode_stop(const Frame& f, DecodedFrame* d) {
  add_code(d, "code", word(f, 0));
}

void decode_calibration_report(const Frame& f, DecodedFrame* d) {
  const int32_t code = load_i32(f.payload.data(), offsetof(calibration_report, pdata_sensor_type));
  add_code(d, "pdata_sensor_type", code);
  std::vector<int64_t> words;
  std::string text;
  for (size_t i = 0; i < 9; ++i) {
    const uint32_t w = load_u32(f.payload.data(), offsetof(calibration_report, word) + 4 * i);
    words.push_back(w);
    if (i > 0) text += " ";
    char buf[16];
    // The magnetometer's words are register values, easier to read in hex.
    snprintf(buf, sizeof buf, code == SENSOR_CODE_MAG ? "0x%08x" : "%u", w);
    text += buf;
  }
  d->fields.push_back(Field{"words", json_array(words), text});
  const int32_t result = load_i32(f.payload.data(), offsetof(calibration_report, result));
  std::string note;
  if (result == -1) {
    note = "no calibration, or a registry error";
  } else if (code == SENSOR_CODE_ACCEL && result == 1) {
    note = "calibrated";
  } else if ((code == SENSOR_CODE_GYRO || code == SENSOR_CODE_MAG || code == SENSOR_CODE_LIGHT) &&
             result == 0) {
    note = "read";
  }
  d->fields.push_back(number("result", result, note));
}

void decode_store_calibration(const Frame& f, DecodedFrame* d) {
  add_code(d, "pdata_sensor_type", load_i32(f.payload.data(), 0));
  const int32_t result = load_i32(f.payload.data(), 4);
  const char* note = result == 0   ? "the sensor completed the calibration"
                     : result == 1 ? "no completion within the daemon's wait"
                                   : "";
  d->fields.push_back(number("result", result, note));
}

// Frame 9. Word 0 says whose reply it is; the accelerometer's words come in the kernel
// driver's order (result word 0, then words 4 to 7, then 1 to 3), the magnetometer's as
// result words 0 and 1, then 2 to 9 from word 9 of the frame.
void decode_selftest(const Frame& f, DecodedFrame* d) {
  const int32_t sensor = word(f, 0);
  const int32_t result = word(f, 1);
  add_sensor_type(d, "sensor_type", sensor);
  if (sensor == SENSOR_TYPE_ACCEL) {
    constexpr int kSource[9] = {-1, 0, 4, 5, 6, 7, 1, 2, 3};  // accel_result word of frame word
    std::vector<int64_t> accel(8);
    d->fields.push_back(
        Field{"result", std::to_string(result), with_note(result, verdict(result == 1))});
    d->fields.push_back(json_only("verdict", json_string(verdict(result == 1))));
    for (int w = 1; w <= 8; ++w) {
      accel[kSource[w]] = word(f, w);
      if (w > 1) {
        d->fields.push_back(text_only("accel_result[" + std::to_string(kSource[w]) + "]",
                                      std::to_string(word(f, w))));
      }
    }
    d->fields.push_back(json_only("accel_result", json_array(accel)));
  } else if (sensor == SENSOR_TYPE_MAG) {
    std::vector<int64_t> mag{result, word(f, 2)};
    for (int w = 9; w <= 16; ++w) mag.push_back(word(f, w));
    d->fields.push_back(
        Field{"result", std::to_string(result), with_note(result, verdict(result == 1))});
    d->fields.push_back(json_only("verdict", json_string(verdict(result == 1))));
    for (size_t i = 1; i < mag.size(); ++i) {
      d->fields.push_back(
          text_only("mag_result[" + std::to_string(i) + "]", std::to_string(mag[i])));
    }
    d->fields.push_back(json_only("mag_result", json_array(mag)));
  } else if (sensor == SENSOR_TYPE_PRESSURE) {
    d->fields.push_back(
        Field{"result", std::to_string(result), with_note(result, verdict(result == 1))});
    d->fields.push_back(json_only("verdict", json_string(verdict(result == 1))));
    // Pascal from the sensor, divided by 100 and truncated by the daemon.
    d->fields.push_back(
        Field{"pressure_hpa", std::to_string(word(f, 2)), std::to_string(word(f, 2)) + " hPa"});
  } else {
    std::vector<int64_t> words;
    for (int w = 0; w < 18; ++w) words.push_back(word(f, w));
    d->fields.push_back(Field{"words", json_array(words), joined(words)});
  }
}

void decode_gyro_temperature(const Frame& f, DecodedFrame* d) {
  d->fields.push_back(number("code", word(f, 0), word(f, 0) == 11 ? "temperature" : ""));
  d->fields.push_back(
      Field{"temperature_c", std::to_string(word(f, 1)), std::to_string(word(f, 1)) + " \u00b0C"});
}

std::string mag_result_note(int32_t result) {
  switch (result) {
    case 0:
      return "passed";
    case 1:
      return "failed with an error code";
    case -1:
      return "no outcome";
    default:
      return "";
  }
}

void decode_mag(const Frame& f, DecodedFrame* d, bool fuse_rom) {
  add_code(d, "code", load_i32(f.payload.data(), offsetof(mag_reply, code)));
  if (fuse_rom) {
    std::vector<int64_t> rom;
    for (size_t i = 0; i < 3; ++i) {
      rom.push_back(load_i32(f.payload.data(), offsetof(mag_reply, fuse_rom) + 4 * i));
    }
    // The sensitivity the daemon derives from the fuse ROM: value / 128 + 1.
    const std::string text =
        joined(rom) + printf_string(" (sensitivity %g %g %g)", rom[0] / 128.0 + 1.0,
                                    rom[1] / 128.0 + 1.0, rom[2] / 128.0 + 1.0);
    d->fields.push_back(Field{"fuse_rom", json_array(rom), text});
  } else {
    const uint8_t* r = f.payload.data() + offsetof(mag_reply, registers);
    d->fields.push_back(Field{"registers", json_string(to_hex(r, 14)), to_hex(r, 14, " ")});
  }
  const int32_t result = load_i32(f.payload.data(), offsetof(mag_reply, result));
  d->fields.push_back(number("result", result, mag_result_note(result)));
}

void decode_gyro_selftest(const Frame& f, DecodedFrame* d) {
  // Names of the 15 words, and where the daemon takes each from the gyroscope's result words.
  static const char* const kNames[15] = {"test_type", "result", "g5",     "offset_x", "offset_y",
                                         "offset_z",  "nost_x", "nost_y", "nost_z",   "st_x",
                                         "st_y",      "st_z",   "diff_x", "diff_y",   "diff_z"};
  static const char* const kSources[15] = {
      "",   "g1", "g5",  "g2 / 1000", "g3 / 1000", "g4 / 1000",  "g6",        "g7",
      "g8", "g9", "g10", "g11",       "|g9 - g6|", "|g10 - g7|", "|g11 - g8|"};
  for (int w = 0; w < 15; ++w) {
    const int32_t v = word(f, w);
    std::string note = kSources[w];
    if (w == 0 && v == 1) note = "self test";
    if (w == 1) note = verdict(v == 1) + ", g1";
    d->fields.push_back(number(kNames[w], v, note));
    if (w == 1) d->fields.push_back(json_only("verdict", json_string(verdict(v == 1))));
  }
}

void decode_lpf(const Frame& f, DecodedFrame* d) {
  const int32_t code = load_i32(f.payload.data(), offsetof(lpf_result, code));
  const char* note = code == 12 ? "filter on" : code == 13 ? "filter off" : "";
  d->fields.push_back(number("code", code, note));
  d->fields.push_back(
      number("lpf_on_off", load_i32(f.payload.data(), offsetof(lpf_result, lpf_on_off))));
}

void decode_register_dump(const Frame& f, DecodedFrame* d) {
  const uint8_t index = load_u8(f.payload.data(), offsetof(register_dump_frame, index));
  const uint8_t* registers = f.payload.data() + offsetof(register_dump_frame, registers);
  // Dumps 4 and 5 (the light sensor) hold registers 0x80 to 0xff.
  const unsigned first =
      (index == SENSOR_TYPE_LIGHT || index == SENSOR_TYPE_LIGHT_SHORT) ? 0x80 : 0x00;
  add_sensor_type(d, "index", index);
  char range[16];
  snprintf(range, sizeof range, "0x%02x-0x%02x", first, first + 127);
  d->fields.push_back(text_only("registers", range));
  d->fields.push_back(json_only("first_address", std::to_string(first)));
  d->fields.push_back(json_only("registers", json_string(to_hex(registers, 128))));
  std::string columns = "         ";
  for (unsigned c = 0; c < 16; ++c) {
    char buf[4];
    snprintf(buf, sizeof buf, c == 0 ? "%02x" : " %02x", c);
    columns += buf;
  }
  d->details.push_back(columns);
  for (unsigned row = 0; row < 8; ++row) {
    char address[8];
    snprintf(address, sizeof address, "0x%02x", first + row * 16);
    d->details.push_back(std::string("    ") + address + " " +
                         to_hex(registers + row * 16, 16, " "));
  }
}

void decode_threshold(const Frame& f, DecodedFrame* d, bool hd) {
  if (hd) {
    d->fields.push_back(number("hd_high", load_i32(f.payload.data(), 8)));
    d->fields.push_back(number("hd_low", load_i32(f.payload.data(), 12)));
  } else {
    d->fields.push_back(number("high", load_i32(f.payload.data(), 0)));
    d->fields.push_back(number("low", load_i32(f.payload.data(), 4)));
  }
}

void decode_hh_refresh(const Frame& f, DecodedFrame* d) {
  const uint16_t value = load_u16(f.payload.data(), 0);
  d->fields.push_back(number(
      "value", value, value == kHhRefreshValue ? "refresh the light-sensor coefficients" : ""));
}

}  // namespace

SampleScale sample_scale(int32_t code) {
  switch (code) {
    case SENSOR_CODE_ACCEL:
      return {"acceleration", "g", "g", 1.0 / 4096, 3};
    case SENSOR_CODE_GYRO:
      return {"angular rate", "\u00b0/s", "dps", 1.0 / 70, 3};
    case SENSOR_CODE_MAG:
      return {"magnetic field", "\u00b5T", "uT", 0.15, 3};
    case SENSOR_CODE_PRESSURE:
      return {"value", "counts", "counts", 1.0, 3};
    default:
      return {"value", "counts", "counts", 1.0, 6};
  }
}

std::string axis_name(size_t axes, size_t index) {
  static const char* const kXyz[3] = {"x", "y", "z"};
  return axes == 3 && index < 3 ? kXyz[index] : "v" + std::to_string(index);
}

std::string frame_type_name(uint16_t type) {
  const outbound_frame* f = outbound_frame_of(type);
  return f != nullptr ? f->name : "unknown";
}

namespace {

// A frame whose nlmsg_len does not fit: the reason, and no fields.
bool decode_malformed(const Frame& frame, DecodedFrame* d) {
  if (!frame.malformed) return false;
  d->name = "malformed";
  if (frame.payload.size() < kFrameHeaderSize) {
    d->problem = "a datagram of " + std::to_string(frame.payload.size()) +
                 " bytes is shorter than a frame header";
  } else if (frame.len < kFrameHeaderSize) {
    d->problem = "nlmsg_len " + std::to_string(frame.len) + " is shorter than the header";
  } else {
    d->problem = "nlmsg_len " + std::to_string(frame.len) + " is beyond the " +
                 std::to_string(frame.payload.size()) + " bytes left in the datagram";
  }
  return true;
}

}  // namespace

DecodedFrame decode_command(const Frame& frame) {
  DecodedFrame d;
  d.frame = frame;
  d.command = true;
  d.one_line = true;
  if (decode_malformed(frame, &d)) return d;
  d.name = command_name(frame.type);
  const std::vector<uint8_t>& p = frame.payload;
  constexpr size_t kDataOffset = kBulkDataOffset - kFrameHeaderSize;
  if (is_bigdata_command(frame.type) && p.size() >= kDataOffset) {
    const int32_t sensor_type = load_i32(p.data(), 0);
    const int32_t length = load_i32(p.data(), 4);
    d.fields.push_back(number("sensor_type", sensor_type));
    d.fields.push_back(number("length", length));
    if (length < 0 || static_cast<size_t>(length) > p.size() - kDataOffset) {
      d.problem = "a length of " + std::to_string(length) + " is beyond the " +
                  std::to_string(p.size() - kDataOffset) + " data bytes of the frame";
      return d;
    }
    const uint8_t* data = p.data() + kDataOffset;
    d.fields.push_back(Field{"data", json_string(to_hex(data, length)), to_hex(data, length, " ")});
    return d;
  }
  std::vector<int64_t> words;
  for (size_t offset = 0; offset + 4 <= p.size(); offset += 4) {
    words.push_back(load_i32(p.data(), offset));
  }
  Field f{"words", json_array(words), joined(words)};
  f.in_text = !words.empty();
  d.fields.push_back(f);
  return d;
}

DecodedFrame decode_by_sender(const Frame& frame) {
  return frame.pid == kDaemonPortId ? decode_frame(frame) : decode_command(frame);
}

DecodedFrame decode_frame(const Frame& frame) {
  DecodedFrame d;
  d.frame = frame;
  if (decode_malformed(frame, &d)) return d;
  d.name = frame_type_name(frame.type);
  const outbound_frame* layout = outbound_frame_of(frame.type);
  if (layout == nullptr) return d;
  if (frame.payload.size() < layout->payload_size) {
    d.problem = "a payload of " + std::to_string(frame.payload.size()) +
                " bytes is shorter than the " + std::to_string(layout->payload_size) +
                " bytes of its layout";
    return d;
  }
  switch (frame.type) {
    case FRAME_STATUS:
      decode_status(frame, &d);
      break;
    case FRAME_SAMPLE:
      decode_sample(frame, &d);
      break;
    case FRAME_STOP_RAW_DATA:
      decode_stop(frame, &d);
      break;
    case FRAME_CALIBRATION_REPORT:
      decode_calibration_report(frame, &d);
      break;
    case FRAME_STORE_CALIBRATION:
      decode_store_calibration(frame, &d);
      break;
    case FRAME_SELFTEST:
      decode_selftest(frame, &d);
      break;
    case FRAME_GYRO_TEMPERATURE:
      decode_gyro_temperature(frame, &d);
      break;
    case FRAME_MAG_FUSE_ROM:
    case FRAME_MAG_REGISTERS:
      decode_mag(frame, &d, frame.type == FRAME_MAG_FUSE_ROM);
      break;
    case FRAME_GYRO_SELFTEST:
      decode_gyro_selftest(frame, &d);
      break;
    case FRAME_ACCEL_LPF_ON:
    case FRAME_ACCEL_LPF_OFF:
      decode_lpf(frame, &d);
      break;
    case FRAME_REGISTER_DUMP:
      decode_register_dump(frame, &d);
      break;
    case FRAME_THRESHOLD:
    case FRAME_HD_THRESHOLD:
      decode_threshold(frame, &d, frame.type == FRAME_HD_THRESHOLD);
      break;
    case FRAME_HH_REFRESH:
      decode_hh_refresh(frame, &d);
      break;
  }
  return d;
}

std::string format_text(const DecodedFrame& d, bool unrelated) {
  const Frame& f = d.frame;
  std::string out = (d.command ? "command " : "type ") + std::to_string(f.type) + " (" + d.name +
                    ")  len " + std::to_string(f.len);
  if (!d.command || f.pid != 0) out += "  pid " + std::to_string(f.pid);
  if (f.flags != 0) out += "  flags " + std::to_string(f.flags);
  if (f.seq != 0) out += "  seq " + std::to_string(f.seq);
  if (unrelated) out += "  [unrelated]";
  if (d.one_line) {
    for (const Field& field : d.fields) {
      if (field.in_text) out += "  " + field.name + " " + field.text;
    }
    if (!d.problem.empty()) out += "  problem: " + d.problem;
    return out + "\n";
  }
  out += "\n";
  if (!d.problem.empty()) out += "  problem: " + d.problem + "\n";
  if (d.fields.empty()) {
    return out + "  payload" + std::string(kTextNameWidth - 7, ' ') + to_hex(f.payload, " ") + "\n";
  }
  for (const Field& field : d.fields) {
    if (!field.in_text) continue;
    std::string name = field.name;
    if (name.size() < kTextNameWidth) name.resize(kTextNameWidth, ' ');
    out += "  " + name + field.text + "\n";
  }
  for (const std::string& line : d.details) out += "  " + line + "\n";
  return out;
}

std::string format_json(const DecodedFrame& d, bool unrelated) {
  const Frame& f = d.frame;
  std::string out = (d.command ? "{\"command\":" : "{\"type\":") + std::to_string(f.type) +
                    ",\"name\":" + json_string(d.name) + ",\"len\":" + std::to_string(f.len) +
                    ",\"pid\":" + std::to_string(f.pid);
  if (f.flags != 0) out += ",\"flags\":" + std::to_string(f.flags);
  if (f.seq != 0) out += ",\"seq\":" + std::to_string(f.seq);
  out += ",\"fields\":{";
  bool first = true;
  for (const Field& field : d.fields) {
    if (!field.in_json) continue;
    if (!first) out += ",";
    first = false;
    out += json_string(field.name) + ":" + field.json;
  }
  out += "},\"payload\":" + json_string(to_hex(f.payload));
  if (!d.problem.empty()) out += ",\"problem\":" + json_string(d.problem);
  if (unrelated) out += ",\"unrelated\":true";
  return out + "}";
}

std::string json_string(const std::string& s) {
  std::string out = "\"";
  for (const char c : s) {
    const unsigned char u = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\') {
      out += '\\';
      out += c;
    } else if (c == '\n') {
      out += "\\n";
    } else if (u < 0x20) {
      char buf[8];
      snprintf(buf, sizeof buf, "\\u%04x", u);
      out += buf;
    } else {
      out += c;
    }
  }
  return out + "\"";
}

}  // namespace kestrelctl
