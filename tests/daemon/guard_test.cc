// SPDX-License-Identifier: Apache-2.0
// The single-instance guard: its socket may be descriptor 0 (a daemon started with its standard
// input closed), and the guard of a second start in the same process is refused.
#include <gtest/gtest.h>
#include <unistd.h>

#include "daemon/startup.h"

namespace {

TEST(GuardDeathTest, AGuardOnDescriptorZeroHoldsThePort) {
  EXPECT_EXIT(
      {
        close(0);
        single_instance_guard();
        single_instance_guard();
      },
      ::testing::ExitedWithCode(1), "Program is already running");
}

}  // namespace
