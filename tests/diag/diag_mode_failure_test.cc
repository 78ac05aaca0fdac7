// SPDX-License-Identifier: Apache-2.0
// DIAG logging when libdiag refuses every buffering mode (KESTREL_DIAG_TX_MODE_RESULT 0, set
// before the stand-in reads its environment): a dump whose mode 0 fails still stops the tool,
// and its restart failing at mode 2 leaves the state at 3, so later dumps find logging running.
#include <stdlib.h>

#include "diag_fixture.h"

namespace {

const int kModesRefused = setenv("KESTREL_DIAG_TX_MODE_RESULT", "0", 1);

Lines refused_mode(int mode) {
  return {"I libdiag: Diag_LSM_Init ok",
          "E sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
          "I libdiag: diag_configure_peripheral_buffering_tx_mode 3 " + std::to_string(mode) +
              " 1 90 -> 0",
          "E sns_set_diag_mode: Failed configuring the peripheral tx_mode, result: 0\n",
          "I libdiag: Diag_LSM_DeInit"};
}

TEST_F(DiagTest, ADumpWhoseModesAreRefusedLeavesTheStateDumping) {
  ASSERT_EQ(kModesRefused, 0);
  set_diag_logging_state(diag_state::logging);
  command(27, {0, 0});
  ASSERT_TRUE(log->wait_for("sns_set_diag_tx_mode: sns_set_diag_mode result: 0\n", 5000ms));
  EXPECT_EQ(view(log->records()),
            Lines{"I diag_logging_thread start\n"} + refused_mode(0) +
                Lines{"E send_dumpstate: sns_set_diag_mode result: 0\n"} + kChecksPass +
                refused_mode(2) + Lines{"E sns_set_diag_tx_mode: sns_set_diag_mode result: 0\n"});
  EXPECT_EQ(tools.calls(), Lines{kStop});
  EXPECT_EQ(diag_logging_state(), diag_state::dumping);
  log->clear();
  command(27, {0, 0});
  EXPECT_TRUE(log->wait_for("diag : Logging System is running\n", 1000ms));
}

}  // namespace
