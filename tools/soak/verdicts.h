// SPDX-License-Identifier: Apache-2.0
// The checks of a tool's run, each printed as it is made ("ok" or "MISS"), and the run's verdict.
#pragma once

#include <string>

namespace kestrel_driver {

class Verdicts {
 public:
  // Lines start "<tool>: "; what a check says is padded to width.
  Verdicts(const char* tool, int width) : tool_(tool), width_(width) {}
  bool check(bool ok, const std::string& what);
  // A miss found outside a check.
  void miss() { ok_ = false; }
  bool ok() const { return ok_; }
  // Prints "<tool>: PASS" or "<tool>: FAIL" and returns the exit status, 0 or 1.
  int finish() const;

 private:
  const char* tool_;
  int width_;
  bool ok_ = true;
};

}  // namespace kestrel_driver
