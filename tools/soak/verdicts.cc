// SPDX-License-Identifier: Apache-2.0
// The checks of a tool's run and its verdict.
#include "tools/soak/verdicts.h"

#include <stdio.h>

namespace kestrel_driver {

bool Verdicts::check(bool ok, const std::string& what) {
  printf("%s: %-*s %s\n", tool_, width_, what.c_str(), ok ? "ok" : "MISS");
  if (!ok) ok_ = false;
  return ok;
}

int Verdicts::finish() const {
  printf("%s: %s\n", tool_, ok_ ? "PASS" : "FAIL");
  return ok_ ? 0 : 1;
}

}  // namespace kestrel_driver
