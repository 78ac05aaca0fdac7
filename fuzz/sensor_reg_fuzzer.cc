// SPDX-License-Identifier: Apache-2.0
// The sensors-registry file of the host build: the parser alone (sensor_reg_host_parse on an
// exact-size copy, with no terminator), the library over the file (open, a read of every item
// the daemon asks for, close), and the daemon's command 4 over the same file for each kind of
// calibration table. The input is the whole file.
//
// Checks besides the sanitizers: the parser takes no more lines than the text has; a failed read
// hands over no buffer; without a buffer the length is 0; every byte a buffer's length promises
// can be read.
#include <stddef.h>
#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <memory>

#include "calibration/registry_reader.h"
#include "fuzz_support.h"
#include "sensor_reg.h"
#include "sensor_reg_host.h"

namespace {

const kestrel_fuzz::fuzz_paths* g_paths = nullptr;

const uint16_t kItems[] = {0,   1,   2,   102, 119, 120, 123, 124, 125, 126, 300,  301,
                           302, 406, 407, 408, 409, 410, 411, 412, 413, 414, 65535};
// sensor_types whose calibration lives in the registry, one per kind of table: the
// accelerometer (first bytes, one of them non-zero), the magnetometer (nine little-endian words,
// all or nothing) and the light sensor (seven words in swapped slots). The gyroscope's table is
// the accelerometer's kind with other items.
const int32_t kSensorTypes[] = {0, 2, 4};

size_t line_count(const uint8_t* data, size_t size) {
  size_t lines = size > 0 ? 1 : 0;
  for (size_t i = 0; i < size; ++i) {
    if (data[i] == '\n') ++lines;
  }
  return lines;
}

void read_every_item() {
  for (uint16_t item : kItems) {
    uint8_t* buffer = nullptr;
    uint8_t length = 0xee;
    const int r = sensor_reg_read(item, 10, &buffer, &length);
    // A "read_error <item> = 0" line makes a read that reports success and hands over nothing,
    // which the daemon must survive: only a buffer promises bytes.
    if (r != 0 && buffer != nullptr) kestrel_fuzz::fail("item %u: failed read with a buffer", item);
    if (buffer == nullptr && length != 0) {
      kestrel_fuzz::fail("item %u: length %u without a buffer (read %d)", item, length, r);
    }
    if (buffer != nullptr && length > 0) {
      // Every byte the length promises is there.
      volatile uint8_t sum = 0;
      for (uint8_t i = 0; i < length; ++i) sum = static_cast<uint8_t>(sum + buffer[i]);
    }
    free(buffer);
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  g_paths = &kestrel_fuzz::setup_fuzz_environment(kestrel_fuzz::kNormalProperties, "");
  kestrel_fuzz::reset_daemon_state(diag_state::stopped);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::unique_ptr<char[]> text(new char[size > 0 ? size : 1]);
  if (size > 0) memcpy(text.get(), data, size);
  const int taken = sensor_reg_host_parse(text.get(), size);
  if (taken < 0 || static_cast<size_t>(taken) > line_count(data, size)) {
    kestrel_fuzz::fail("%d lines taken from a text of %zu lines", taken, line_count(data, size));
  }

  // A new version of the file: its open failures are counted afresh (every open reads the file).
  kestrel_fuzz::write_file(g_paths->registry, data, size);

  if (sensor_reg_open() == 0) read_every_item();
  sensor_reg_close();

  for (int32_t sensor_type : kSensorTypes) {
    // A command 4 frame of exactly the bytes the command reads.
    std::unique_ptr<uint8_t[]> frame(new uint8_t[20]());
    const uint32_t len = 20;
    const uint16_t command = 4;
    memcpy(frame.get(), &len, 4);
    memcpy(frame.get() + 4, &command, 2);
    memcpy(frame.get() + 16, &sensor_type, 4);
    read_calib_data(frame.get());
  }
  return 0;
}
