// Found by the sensor_reg fuzz target: a registry line "read_error <item> = 0" makes
// sensor_reg_read report success while it hands over no buffer and length 0. Command 4 must take
// such an item as one of no bytes (value 0, the word left as it is) and still report, byte for
// byte, with every other item decoded.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <string.h>

#include <string>
#include <vector>

#include "daemon_fixture.h"

namespace {

using Bytes = std::vector<uint8_t>;
using ::testing::Contains;

// The whole frame of type 5: code, nine words, result (60 bytes, no alignment bytes).
Bytes report_frame(int32_t code, const std::vector<uint32_t>& words, int32_t result) {
  Bytes f(60, 0);
  const uint32_t len = 60;
  const uint16_t type = 5;
  const uint32_t pid = 20000;
  memcpy(&f[0], &len, 4);
  memcpy(&f[4], &type, 2);
  memcpy(&f[12], &pid, 4);
  memcpy(&f[16], &code, 4);
  for (size_t i = 0; i < words.size(); ++i) memcpy(&f[20 + 4 * i], &words[i], 4);
  memcpy(&f[56], &result, 4);
  return f;
}

class RegistryReadWithoutDataTest : public DaemonFixture {
 protected:
  // Command 4 for sensor_type over the registry text; the report frame as received.
  Bytes report(int32_t sensor_type, const std::string& registry) {
    write_file(test_registry_path(), registry);
    log->clear();
    command(4, {sensor_type});
    std::optional<Frame> f = kernel->next_frame_of_type(5, 2000ms);
    return f ? f->raw : Bytes{};
  }
};

TEST_F(RegistryReadWithoutDataTest, ItemReadWithoutBufferCountsAsAnItemOfNoBytes) {
  // The fuzzer's input, reduced: the accelerometer's third offset succeeds without data.
  EXPECT_EQ(report(0, "0 = 03\n1 = fe\nread_error 2 = 0\n"), report_frame(0, {3, 0xfe, 0}, 1));
  EXPECT_THAT(log->messages("libsensor_reg"), Contains("read 2 -> 0 len 0"));
  EXPECT_THAT(lines(), Contains("read_calib_data: ID=0, Type=0, Result=1, Val=3,254,0"));

  // All three without data: no offset at all.
  EXPECT_EQ(report(0, "read_error 0 = 0\nread_error 1 = 0\nread_error 2 = 0\n"),
            report_frame(0, {0, 0, 0}, -1));

  // The magnetometer's nine words: the one without data stays 0 and the rest still decode; the
  // reads all succeeded, so nothing is cleared.
  std::string soft_iron = "406 = 4a 27 00 00\nread_error 407 = 0\n";
  for (int item = 408; item <= 414; ++item) soft_iron += std::to_string(item) + " = 01\n";
  EXPECT_EQ(report(2, soft_iron), report_frame(2, {0x274a, 0, 1, 1, 1, 1, 1, 1, 1}, 0));
}

}  // namespace
