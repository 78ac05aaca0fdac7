// SPDX-License-Identifier: Apache-2.0
// Found by the sensor_reg fuzz target: a registry line "read_error <item> = 0" makes
// sensor_reg_read report success while it hands over no buffer and length 0. Command 4 must take
// such an item as one of no bytes (value 0, the word left as it is) and still report, byte for
// byte, with every other item decoded.
#include "request_fixture.h"

namespace request_test {
namespace {

using ::testing::Contains;

class RegistryReadWithoutDataTest : public RequestTest {
 protected:
  // Command 4 for sensor_type over the registry text; the report frame as received.
  Bytes report(int32_t sensor_type, const std::string& registry) {
    write_file(test_registry_path(), registry);
    log->clear();
    command(4, {sensor_type});
    return frame(5);
  }
};

// The report frame: code, nine words, result.
TEST_F(RegistryReadWithoutDataTest, ItemReadWithoutBufferCountsAsAnItemOfNoBytes) {
  // The fuzzer's input, reduced: the accelerometer's third offset succeeds without data.
  EXPECT_EQ(report(0, "0 = 03\n1 = fe\nread_error 2 = 0\n"),
            word_frame(5, {0, 3, 0xfe, 0, 0, 0, 0, 0, 0, 0, 1}));
  EXPECT_THAT(log->messages("libsensor_reg"), Contains("read 2 -> 0 len 0"));
  EXPECT_THAT(lines(), Contains("read_calib_data: ID=0, Type=0, Result=1, Val=3,254,0"));

  // All three without data: no offset at all.
  EXPECT_EQ(report(0, "read_error 0 = 0\nread_error 1 = 0\nread_error 2 = 0\n"),
            word_frame(5, {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, -1}));

  // The magnetometer's nine words: the one without data stays 0 and the rest still decode; the
  // reads all succeeded, so nothing is cleared.
  std::string soft_iron = "406 = 4a 27 00 00\nread_error 407 = 0\n";
  for (int item = 408; item <= 414; ++item) soft_iron += std::to_string(item) + " = 01\n";
  EXPECT_EQ(report(2, soft_iron), word_frame(5, {2, 0x274a, 0, 1, 1, 1, 1, 1, 1, 1, 0}));
}

}  // namespace
}  // namespace request_test
