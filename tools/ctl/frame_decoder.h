// SPDX-License-Identifier: Apache-2.0
// Decoding of the frames the daemon sends to the kernel factory driver, to readable text and to
// one-line JSON for the scripts of the test stations.
//
// Self-test verdicts are read from word 1 of the reply (frames 9 and 14), the sensor's own
// result word that the daemon relays unchanged: 1 is PASS, anything else FAIL. For the
// magnetometer the daemon itself writes -1 there when the sensor reports a failed test.
#pragma once

#include <stdint.h>

#include <string>
#include <vector>

#include "frame_codec.h"

namespace kestrelctl {

// One decoded value. json is a JSON literal (1013, "PASS", [1,2], "0a0b"); text is what a
// person reads ("1013 hPa", "1 (PASS)"). Some fields show in one form only: the self-test words
// appear in text in frame order under their source names and in JSON as one array in the
// sensor's order.
struct Field {
  std::string name;
  std::string json;
  std::string text;
  bool in_text = true;
  bool in_json = true;
};

struct DecodedFrame {
  Frame frame;
  std::string name;                  // "selftest"; "unknown" for a type without a layout
  std::vector<Field> fields;         // empty for unknown types and short payloads
  std::vector<std::string> details;  // further text lines (the register-dump table)
  std::string problem;               // why the payload was not decoded, if it was not
  bool one_line = false;             // samples and commands print on one line
  bool command = false;              // a frame to the daemon: its type is a command number
};

// The name of an outbound frame type ("status", "selftest", ...), "unknown" otherwise.
std::string frame_type_name(uint16_t type);

DecodedFrame decode_frame(const Frame& frame);

// A frame the kernel driver sends to the daemon: the command's name and its words, or for bulk
// data sensor_type, length and the data bytes.
DecodedFrame decode_command(const Frame& frame);

// Either of the two, told by the sender's port id: the daemon's frames carry 20000.
DecodedFrame decode_by_sender(const Frame& frame);

// The physical quantity of the values of a sample (frame 2), by its code, as the daemon scales
// them: accelerometer 4096 counts a g, gyroscope 70 counts a degree per second, magnetometer
// 0.15 uT a count. Other codes carry counts. axes is 3 (x, y, z) or 6 (values 0 to 5).
struct SampleScale {
  std::string quantity;    // "acceleration"
  std::string unit;        // for people: "g", "°/s", "µT" or "counts"
  std::string ascii_unit;  // the same for file headers: "g", "dps", "uT", "counts"
  double per_count = 1.0;
  size_t axes = 3;
};
SampleScale sample_scale(int32_t code);
// "x", "y", "z" for three axes, else "v0" to "v5".
std::string axis_name(size_t axes, size_t index);

// A header line, "type 9 (selftest)  len 88  pid 20000", then one indented line a field (or,
// for samples, all on the header line). unrelated marks a frame that is not the reply a command
// waits for. Every line ends in a newline. A command is one line,
// "command 8 (selftest)  len 20  words 0", its pid shown when not 0.
std::string format_text(const DecodedFrame& decoded, bool unrelated = false);

// {"type":9,"name":"selftest","len":88,"pid":20000,"fields":{...},"payload":"..."}, without a
// newline; "flags" and "seq" only when not 0, "problem" and "unrelated":true only when they
// apply. A command has "command" in the place of "type".
std::string format_json(const DecodedFrame& decoded, bool unrelated = false);

// A JSON string literal of s, quotes included.
std::string json_string(const std::string& s);

}  // namespace kestrelctl
