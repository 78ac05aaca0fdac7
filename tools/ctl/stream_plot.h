// SPDX-License-Identifier: Apache-2.0
// The samples of a stream (frame 2) over time, written as CSV or drawn by gnuplot (PNG or SVG) in
// the physical units of their sensor (sample_scale).
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

#include "frame_codec.h"

namespace kestrelctl {

class StreamSamples {
 public:
  // A sample frame received at time (seconds, any epoch). The stream is the sensor of the first
  // sample; samples with another code are counted in others() and left out. Malformed or short
  // frames and frames of other types are ignored.
  void add(const Frame& frame, double time);

  size_t size() const { return samples_.size(); }
  size_t others() const { return others_; }

  // time_s and one column an axis, named with its unit ("x_g"); times from the first sample.
  bool write_csv(const std::string& path, std::string* error) const;
  // A PNG (.png) or SVG (.svg) picture, one curve an axis.
  bool write_plot(const std::string& path, std::string* error) const;
  // Whether path names a picture write_plot can draw.
  static bool is_plot_path(const std::string& path);

 private:
  struct Sample {
    double time;
    int16_t values[6];
  };
  int32_t code_ = 0;
  std::vector<Sample> samples_;
  size_t others_ = 0;
};

}  // namespace kestrelctl
