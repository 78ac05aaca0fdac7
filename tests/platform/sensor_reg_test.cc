// The sensors-registry stand-in on its own: the file format, the per-version count of failed
// opens, the malloc'ed copies it hands over, its log lines, and the parser's tolerance of input
// that is not a registry.
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "log_capture.h"
#include "sensor_reg.h"
#include "sensor_reg_host.h"
#include "test_env.h"

using ::testing::ElementsAre;

namespace {

struct read_outcome {
  int result;
  std::vector<uint8_t> bytes;  // the buffer's contents, as long as the reported length
  bool buffer;
  uint8_t length;
};

read_outcome read_item(uint16_t id) {
  uint8_t* data = reinterpret_cast<uint8_t*>(0x1);  // must be overwritten
  uint8_t len = 0xEE;
  read_outcome o;
  o.result = sensor_reg_read(id, 10, &data, &len);
  o.buffer = data != nullptr;
  o.length = len;
  if (data != nullptr) {
    o.bytes.assign(data, data + len);
    free(data);
  }
  return o;
}

std::vector<uint8_t> bytes(std::initializer_list<uint8_t> b) {
  return b;
}

class SensorRegTest : public ::testing::Test {
 protected:
  void SetUp() override { log.clear(); }
  void TearDown() override { remove_file(test_registry_path()); }

  // Sets the file's modification time, so a rewrite is a new version however fast it comes.
  void set_mtime(long seconds) {
    struct timespec times[2] = {{seconds, 0}, {seconds, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, test_registry_path().c_str(), times, 0), 0);
  }

  std::vector<int> opens(int n) {
    std::vector<int> r;
    for (int i = 0; i < n; ++i) {
      r.push_back(sensor_reg_open());
      sensor_reg_close();
    }
    return r;
  }

  LogCapture log;
};

TEST_F(SensorRegTest, ServesItemsErrorsAndCloseResultWithOneLinePerCall) {
  write_file(test_registry_path(),
             "# accelerometer offsets\n"
             "0 = 05\n"
             "406 = 01 02 03 04   # trailing comment\n"
             "407 =\n"
             "408 = 00 00\n"
             "  409  =  0102030405 a B  \r\n"
             "119 = 11\n"
             "read_error 119 = 5\n"
             "close_result = 7\n");
  ASSERT_EQ(sensor_reg_open(), 0);

  read_outcome o = read_item(406);
  EXPECT_EQ(o.result, 0);
  EXPECT_EQ(o.bytes, bytes({1, 2, 3, 4}));
  o = read_item(407);  // an item of no bytes still hands over a block to free
  EXPECT_EQ(o.result, 0);
  EXPECT_TRUE(o.buffer);
  EXPECT_EQ(o.length, 0);
  EXPECT_EQ(read_item(408).bytes, bytes({0, 0}));
  EXPECT_EQ(read_item(409).bytes, bytes({1, 2, 3, 4, 5, 0xa, 0xb}));
  o = read_item(119);  // the read error wins over the item's bytes
  EXPECT_EQ(o.result, 5);
  EXPECT_FALSE(o.buffer);
  EXPECT_EQ(o.length, 0);
  o = read_item(1);  // not in the file
  EXPECT_EQ(o.result, -1);
  EXPECT_FALSE(o.buffer);
  EXPECT_EQ(o.length, 0);
  EXPECT_EQ(sensor_reg_close(), 7);
  // Closed: nothing is served any more.
  EXPECT_EQ(read_item(406).result, -1);

  EXPECT_THAT(log.messages("libsensor_reg"),
              ElementsAre("open -> 0", "read 406 -> 0 len 4", "read 407 -> 0 len 0",
                          "read 408 -> 0 len 2", "read 409 -> 0 len 7", "read 119 -> 5 len 0",
                          "read 1 -> -1 len 0", "close -> 7", "read 406 -> -1 len 0"));
  for (const LogRecord& r : log.records()) EXPECT_EQ(r.priority, 4) << r.message;
}

TEST_F(SensorRegTest, MissingFileIsAnEmptyRegistry) {
  remove_file(test_registry_path());
  EXPECT_EQ(sensor_reg_open(), 0);
  EXPECT_EQ(read_item(0).result, -1);
  EXPECT_EQ(sensor_reg_close(), 0);
}

TEST_F(SensorRegTest, FailedOpensAreCountedPerVersionOfTheFile) {
  write_file(test_registry_path(), "open_failures = 2\n0 = 01\n");
  set_mtime(1000);
  EXPECT_EQ(sensor_reg_open(), -1);
  EXPECT_EQ(read_item(0).result, -1);  // a failed open serves nothing
  sensor_reg_close();
  EXPECT_THAT(opens(3), ElementsAre(-1, 0, 0));

  // The same text written again: a new modification time makes it a new version.
  write_file(test_registry_path(), "open_failures = 2\n0 = 01\n");
  set_mtime(2000);
  EXPECT_THAT(opens(3), ElementsAre(-1, -1, 0));

  // New text under the same modification time is a new version as well.
  write_file(test_registry_path(), "open_failures = 1\n0 = 02\n");
  set_mtime(2000);
  EXPECT_THAT(opens(2), ElementsAre(-1, 0));

  // Unchanged file: the count goes on where it was.
  EXPECT_THAT(opens(1), ElementsAre(0));
  EXPECT_EQ(sensor_reg_open(), 0);
  EXPECT_EQ(read_item(0).bytes, bytes({2}));
  sensor_reg_close();
}

TEST_F(SensorRegTest, ParserIgnoresEveryMalformedLine) {
  const std::string bad[] = {
      "406 = 0g",
      "406 = 012",
      "406 01",
      "= 01",
      "70000 = 01",
      "-1 = 01",
      "+5 = 01",
      "4x6 = 01",
      "read_error = 5",
      "read_error 1 = x",
      "read_error1 = 5",
      "read_error 1 = 99999999999",
      "open_failures = -1",
      "open_failures =",
      "close_result = 1 2",
      "unknown = 1",
      "406 = 01 = 02",
      "# 406 = 01",
      "   ",
      "",
  };
  for (const std::string& line : bad) {
    EXPECT_EQ(sensor_reg_host_parse(line.data(), line.size()), 0) << line;
  }

  // The largest item a one-byte length can report is taken; one byte more drops the line.
  std::string longest = "1 =";
  for (int i = 0; i < 255; ++i) longest += " ff";
  EXPECT_EQ(sensor_reg_host_parse(longest.data(), longest.size()), 1);
  const std::string too_long = longest + " ff";
  EXPECT_EQ(sensor_reg_host_parse(too_long.data(), too_long.size()), 0);
  const std::string packed = "1 = " + std::string(512, 'a');
  EXPECT_EQ(sensor_reg_host_parse(packed.data(), packed.size()), 0);

  // A huge line, embedded NUL bytes and a last line without newline around good lines.
  std::string mixed = "0 = 01\n" + std::string(200000, '7') + " = 01\n";
  mixed += std::string("1 = 02\0 03\n", 11);
  mixed += "close_result = -3";
  EXPECT_EQ(sensor_reg_host_parse(mixed.data(), mixed.size()), 2);

  // The same through the file: the good lines are served, the long item whole.
  write_file(test_registry_path(), longest + "\n" + mixed + "\n406 = zz\n");
  ASSERT_EQ(sensor_reg_open(), 0);
  EXPECT_EQ(read_item(1).bytes, std::vector<uint8_t>(255, 0xff));
  EXPECT_EQ(read_item(0).bytes, bytes({1}));
  EXPECT_EQ(read_item(406).result, -1);
  EXPECT_EQ(sensor_reg_close(), -3);
}

}  // namespace
