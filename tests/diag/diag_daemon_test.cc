// kestreld as a process whose libdiag cannot be initialised, or refuses the buffering mode:
// logging does not start at boot, and a dump then finds it disabled.
#include <gtest/gtest.h>

#include "daemon_process.h"
#include "diag_fixture.h"
#include "kernel_port.h"
#include "tools/sim/simulator.h"

namespace {

// A message's own trailing newline only shows once the next record came: compared without it.
Lines without_newlines(Lines lines) {
  for (std::string& line : lines) {
    if (!line.empty() && line.back() == '\n') line.pop_back();
  }
  return lines;
}

TEST(DiagDaemon, BootLeavesLoggingOffWhenLibdiagFails) {
  const Lines boot = Lines{"I diag_logging_start_thread start\n",
                           "I sensor1_open_or_reopen: sensor1_open success\n"} +
                     kChecksPass;
  struct Case {
    DaemonEnv env;
    Lines expected;  // from libdiag's first call to the last line of sns_set_diag_tx_mode
  };
  const Case cases[] = {
      {{{"KESTREL_DIAG_INIT", "fail"}},
       {"I libdiag: Diag_LSM_Init fail", "E sns_set_diag_mode: Diag_LSM_Init failed",
        "I libdiag: Diag_LSM_DeInit", "E sns_set_diag_tx_mode: sns_set_diag_mode result: -1"}},
      {{{"KESTREL_DIAG_TX_MODE_RESULT", "0"}},
       {"I libdiag: Diag_LSM_Init ok",
        "E sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter",
        "I libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 0",
        "E sns_set_diag_mode: Failed configuring the peripheral tx_mode, result: 0",
        "I libdiag: Diag_LSM_DeInit", "E sns_set_diag_tx_mode: sns_set_diag_mode result: 0"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.env.begin()->first);
    kestrel_sim::Simulator sim(test_socket_path(), true);
    kestrelctl::KernelPort kernel;
    ASSERT_TRUE(kernel.open_bound(100));
    FakeTools tools;
    DaemonProcess daemon(c.env, tools.dir());

    ASSERT_TRUE(daemon.wait_for(c.expected.back().substr(2) + "\n", 20000ms)) << daemon.output();
    // The state is still 0: a dump finds logging disabled, and the tool never ran.
    ASSERT_TRUE(kernel.send(kestrelctl::build_command(27, {0, 0})));
    ASSERT_TRUE(daemon.wait_for("diag : Diabled Logging System\n", 5000ms)) << daemon.output();
    EXPECT_EQ(without_newlines(view(daemon.records(),
                                    {"diag_logging", "sensor1_open_or_reopen: sensor1_open success",
                                     "check_", "sns_set_diag", "diag :"})),
              without_newlines(boot + c.expected + Lines{"I diag : Diabled Logging System"}));
    EXPECT_TRUE(tools.calls().empty());
  }
}

}  // namespace
