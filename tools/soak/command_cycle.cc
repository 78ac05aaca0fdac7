// SPDX-License-Identifier: Apache-2.0
// The commands of every kind the daemon serves.
#include "tools/soak/command_cycle.h"

#include "byte_order.h"
#include "frame_codec.h"
#include "kernel_frame.h"

namespace kestrel_driver {

std::vector<Planned> cycle(long c) {
  using kestrelctl::build_bigdata;
  using kestrelctl::build_command;
  const int32_t sensor =
      static_cast<int32_t>(c % 4);            // accelerometer, gyro, magnetometer, pressure
  const int32_t stream = c % 2 == 0 ? 0 : 4;  // a sensor-manager or a light-sensor stream
  const int32_t calib[] = {0, 1, 2, 4};
  const std::vector<uint8_t> data = {1, 2, 3, 4, 5, 6, 7, 8};
  std::vector<Planned> out = {
      {build_command(0, {sensor}), 0},
      {build_command(1, {stream}), -1},
      {build_command(3, {stream}), 3},
      {build_command(4, {calib[c % 4]}), 5},
      {build_command(6, {sensor, 1}), 7},
      {build_command(8, {sensor}), sensor == 1 ? 14 : 9},
      {build_command(10), 10},
      {build_command(11), 11},
      {build_command(12), 12},
      {build_command(15), 15},
      {build_command(16), 16},
      {build_command(17), -1},
      {build_command(18), -1},
      {build_command(19, {static_cast<int32_t>(c % 6)}), 20},
  };
  out.push_back({build_command(27, {0, 2}), -1});
  for (const bigdata_kind& kind : kBigdataKinds) {
    out.push_back({build_bigdata(kind.command, 4, data), kind.reply_frame});
  }
  out.push_back({kestrelctl::build_hidden_hole({1, 2, 3, 4, 5, 6, 7, 8, 9}), -1});
  if (c % 10 == 9) out.push_back({build_command(36), -1});
  return out;
}

uint16_t command_of(const std::vector<uint8_t>& datagram) {
  return load_u16(datagram.data(), 4);
}

}  // namespace kestrel_driver
