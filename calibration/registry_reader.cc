// SPDX-License-Identifier: Apache-2.0
// Command 4: the factory calibration of one sensor, read from the sensors registry and reported
// to the kernel driver as one calibration_report (frame type 5). The registry is opened and
// closed anew for every command; nothing outlives it.
#include "registry_reader.h"

#include <stdlib.h>

#include "byte_order.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "requests/sensor_tables.h"
#include "sensor_reg.h"

namespace {

constexpr const char* kName = "read_calib_data";
constexpr uint32_t kOpenAttempts = 50;
constexpr uint32_t kReadArgument = 10;
constexpr int kSlots = 9;

// How the items of a sensor code become report words.
enum class decoding {
  kFirstByte,     // the item's first byte, set after all reads succeeded
  kLittleEndian,  // the item's first four bytes, decoded right after its read
};

struct registry_item {
  uint16_t id;
  int word;
};

struct item_table {
  int32_t pdata_sensor_type;
  decoding how;
  int count;
  registry_item items[kSlots];
};

// Items in call order; slot i holds the buffer of items[i]. The light sensor's table swaps the
// words of 119/120 and of 125/126 on purpose: that is where the kernel driver expects them.
constexpr item_table kTables[] = {
    {0, decoding::kFirstByte, 3, {{0, 0}, {1, 1}, {2, 2}}},
    {1, decoding::kFirstByte, 3, {{300, 0}, {301, 1}, {302, 2}}},
    {2,
     decoding::kLittleEndian,
     9,
     {{406, 0}, {407, 1}, {408, 2}, {409, 3}, {410, 4}, {411, 5}, {412, 6}, {413, 7}, {414, 8}}},
    {5,
     decoding::kLittleEndian,
     7,
     {{102, 0}, {119, 2}, {120, 1}, {123, 3}, {124, 4}, {125, 6}, {126, 5}}},
};

const item_table* table_for(int32_t pdata) {
  for (const item_table& t : kTables) {
    if (t.pdata_sensor_type == pdata) return &t;
  }
  return nullptr;
}

// The item's bytes, last to first, shifted into the word: the first four bytes read as a
// little-endian number. Counts the shared length byte down to 0 as it goes.
uint32_t decode_little_endian(uint32_t word, const uint8_t* buffer, uint8_t* length) {
  if (buffer == nullptr) {
    *length = 0;
    return word;
  }
  while (*length > 0) {
    --*length;
    word = (word << 8) | buffer[*length];
  }
  return word;
}

int open_registry() {
  int r = -1;
  for (uint32_t left = kOpenAttempts; left > 0; --left) {
    r = sensor_reg_open();
    KLOGE("Inside While %d, count %u", r, left);
    if (r == 0) break;
  }
  KLOGI("Outside While %d", r);
  return r;
}

// Reads every item of table into buffers and the report's words, logs the words of the codes
// that log them, and sets the result: errors (the open's) or a failed read clear the words the
// code loses and make it -1.
void fill_report(const item_table& table, int errors, uint8_t* (&buffers)[kSlots],
                 calibration_report* report) {
  const int32_t pdata = report->pdata_sensor_type;
  uint8_t lengths[kSlots] = {};
  uint8_t length = 0;  // one length byte for every read, as the library reports it
  for (int slot = 0; slot < table.count; ++slot) {
    const registry_item& item = table.items[slot];
    errors |= sensor_reg_read(item.id, kReadArgument, &buffers[slot], &length);
    lengths[slot] = length;
    if (table.how == decoding::kLittleEndian && length != 0) {
      report->word[item.word] =
          decode_little_endian(report->word[item.word], buffers[slot], &length);
    }
  }
  if (errors == 0 && table.how == decoding::kFirstByte) {
    bool any = false;
    for (int slot = 0; slot < table.count; ++slot) {
      const uint8_t v = (buffers[slot] != nullptr && lengths[slot] != 0) ? buffers[slot][0] : 0;
      report->word[table.items[slot].word] = v;
      any = any || v != 0;
    }
    // The accelerometer's offsets count as present only when one of them is non-zero.
    report->result = pdata != 0 ? 0 : (any ? 1 : -1);
  }
  const uint32_t* word = report->word;
  if (pdata == 2) {
    KLOGI("SI param 0x%08x 0x%08x 0x%08x 0x%08x 0x%08x 0x%08x 0x%08x 0x%08x 0x%08x ", word[0],
          word[1], word[2], word[3], word[4], word[5], word[6], word[7], word[8]);
  } else if (pdata == 5) {
    KLOGI("pdata.trim %d", static_cast<int32_t>(word[4]));
  }
  if (errors == 0 && table.how == decoding::kLittleEndian) report->result = 0;
  if (errors != 0) {
    // The soft-iron parameters are all or nothing; the other codes lose words 0..2 only.
    const int cleared = pdata == 2 ? 9 : 3;
    for (int w = 0; w < cleared; ++w) report->word[w] = 0;
    report->result = -1;
  }
}

}  // namespace

int read_calib_data(const uint8_t* frame) {
  const int32_t sensor_type = load_i32(frame, kSensorTypeOffset);
  const int32_t smgr_id = smgr_id_by_sensor_type(sensor_type);
  const int32_t pdata = pdata_sensor_type(smgr_id);
  KLOGI("%s: sensor_type %d\n", kName, pdata);

  calibration_report report = {};
  report.pdata_sensor_type = pdata;
  report.result = -1;
  uint8_t* buffers[kSlots] = {};

  const int errors = open_registry();
  const item_table* table = table_for(pdata);
  if (table != nullptr) fill_report(*table, errors, buffers, &report);

  KLOGI("%s: ID=%d, Type=%d, Result=%d, Val=%d,%d,%d", kName, smgr_id, pdata, report.result,
        static_cast<int32_t>(report.word[0]), static_cast<int32_t>(report.word[1]),
        static_cast<int32_t>(report.word[2]));
  send_to_kernel(FRAME_CALIBRATION_REPORT, &report, sizeof report);

  for (uint8_t* buffer : buffers) free(buffer);
  const int closed = sensor_reg_close();
  if (closed != 0) KLOGE("%s: Error in sensor_reg_close(): %i", kName, closed);
  return report.result;
}
