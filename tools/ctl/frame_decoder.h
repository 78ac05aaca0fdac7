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
  bool one_line = false;             // samples print on one line
};

// The name of an outbound frame type ("status", "selftest", ...), "unknown" otherwise.
std::string frame_type_name(uint16_t type);

DecodedFrame decode_frame(const Frame& frame);

// A header line, "type 9 (selftest)  len 88  pid 20000", then one indented line a field (or,
// for samples, all on the header line). unrelated marks a frame that is not the reply a command
// waits for. Every line ends in a newline.
std::string format_text(const DecodedFrame& decoded, bool unrelated = false);

// {"type":9,"name":"selftest","len":88,"pid":20000,"fields":{...},"payload":"..."}, without a
// newline; "flags" and "seq" only when not 0, "problem" and "unrelated":true only when they
// apply.
std::string format_json(const DecodedFrame& decoded, bool unrelated = false);

// A JSON string literal of s, quotes included.
std::string json_string(const std::string& s);

}  // namespace kestrelctl
