// SPDX-License-Identifier: Apache-2.0
// The sensors-registry stand-in's parser on its own: its tolerance of input that is not a registry.
// What it serves of a good file is driven through the daemon's registry reads.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <string>
#include <vector>

#include "sensor_reg.h"
#include "sensor_reg_host.h"
#include "test_env.h"

namespace {

// "<result> <hex bytes>" of one read; "-" for no buffer. The length must be 0 without one.
std::string read_item(uint16_t id) {
  uint8_t* data = reinterpret_cast<uint8_t*>(0x1);  // must be overwritten
  uint8_t len = 0xEE;
  std::string s = std::to_string(sensor_reg_read(id, 10, &data, &len)) + " ";
  if (data == nullptr) return s + (len == 0 ? "-" : "- with a length");
  static const char kHex[] = "0123456789abcdef";
  for (uint8_t i = 0; i < len; ++i) s += {kHex[data[i] >> 4], kHex[data[i] & 15]};
  free(data);
  return s;
}

// Lines that are not a registry's are ignored as a whole, each on its own and around good ones.
TEST(SensorRegTest, ParserIgnoresBadAndLongLines) {
  const std::string bad =
      "406 = 0g\n406 = 012\n406 01\n= 01\n70000 = 01\n-1 = 01\n+5 = 01\n4x6 = 01\n"
      "read_error = 5\nread_error 1 = x\nread_error1 = 5\nread_error 1 = 99999999999\n"
      "open_failures = -1\nopen_failures =\nclose_result = 1 2\nunknown = 1\n406 = 01 = 02\n"
      "# 406 = 01\n   \n\n";
  EXPECT_EQ(sensor_reg_host_parse(bad.data(), bad.size()), 0);
  // The largest item a one-byte length can report is taken (1), one byte more drops the line
  // (2), and so does a long packed token (3); then a huge line, embedded NUL bytes (4) and a
  // last line without a newline.
  std::string bytes;
  for (int i = 0; i < 255; ++i) bytes += " ff";
  const std::string text =
      bad + "1 =" + bytes + "\n2 =" + bytes + " ff\n3 = " + std::string(512, 'a') + "\n0 = 01\n" +
      std::string(200000, '7') + " = 01\n" + std::string("4 = 02\0 03\n", 11) + "close_result = -3";
  EXPECT_EQ(sensor_reg_host_parse(text.data(), text.size()), 3);
  write_file(test_registry_path(), text);
  ASSERT_EQ(sensor_reg_open(), 0);
  EXPECT_EQ(read_item(1), "0 " + std::string(510, 'f'));
  EXPECT_EQ(read_item(0), "0 01");
  for (const uint16_t id : {2, 3, 4, 406}) EXPECT_EQ(read_item(id), "-1 -") << id;
  EXPECT_EQ(sensor_reg_close(), -3);
  EXPECT_EQ(read_item(0), "-1 -");  // closed: nothing is served any more
}

}  // namespace
