// kestreld as a process: DIAG logging at boot with libdiag healthy, unable to initialise, or
// refusing the buffering mode.
#include <gtest/gtest.h>

#include "daemon_process.h"
#include "kernel_peer.h"
#include "test_env.h"
#include "tools/sim/simulator.h"

namespace {

using Lines = std::vector<std::string>;
using std::chrono_literals::operator""ms;

Lines operator+(Lines a, const Lines& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// "<priority letter> <message>" of the start thread's work, libdiag's calls and command 27's
// lines. A message's own trailing newline is dropped: it only shows once the next record came.
Lines boot_lines(const DaemonProcess& daemon) {
  Lines out;
  for (const LogRecord& r : daemon.records()) {
    std::string m = r.message;
    if (!m.empty() && m.back() == '\n') m.pop_back();
    const std::string p(1, "??VDIWEF"[r.priority & 7]);
    if (r.tag == "libdiag") out.push_back(p + " libdiag: " + m);
    if (r.tag != "KESTRELD") continue;
    for (const char* prefix : {"diag_logging", "sensor1_open_or_reopen: sensor1_open success",
                               "check_", "sns_set_diag", "diag :"}) {
      if (m.rfind(prefix, 0) == 0) out.push_back(p + " " + m);
    }
  }
  return out;
}

TEST(DiagDaemon, BootStartsLoggingOnlyWhenLibdiagSetsTheMode) {
  const Lines before = {"I diag_logging_start_thread start",
                        "I sensor1_open_or_reopen: sensor1_open success",
                        "I check_property Success", "I check_files is not exist -1"};
  const std::string enter =
      "E sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter";
  struct Case {
    std::map<std::string, std::string> env;
    Lines expected;  // up to the last line of sns_set_diag_tx_mode
  };
  const Case cases[] = {
      {{},
       before + Lines{"I libdiag: Diag_LSM_Init ok", enter,
                      "I libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 1",
                      "I libdiag: Diag_LSM_DeInit", "I sns_set_diag_tx_mode: diag_mdlog Enter 1"}},
      {{{"KESTREL_DIAG_INIT", "fail"}},
       before + Lines{"I libdiag: Diag_LSM_Init fail", "E sns_set_diag_mode: Diag_LSM_Init failed",
                      "I libdiag: Diag_LSM_DeInit",
                      "E sns_set_diag_tx_mode: sns_set_diag_mode result: -1"}},
      {{{"KESTREL_DIAG_TX_MODE_RESULT", "0"}},
       before + Lines{"I libdiag: Diag_LSM_Init ok", enter,
                      "I libdiag: diag_configure_peripheral_buffering_tx_mode 3 2 1 90 -> 0",
                      "E sns_set_diag_mode: Failed configuring the peripheral tx_mode, result: 0",
                      "I libdiag: Diag_LSM_DeInit",
                      "E sns_set_diag_tx_mode: sns_set_diag_mode result: 0"}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.env.empty() ? "libdiag healthy" : c.env.begin()->first);
    kestrel_sim::Simulator sim(test_socket_path(), true);
    KernelPeer kernel(100);
    ASSERT_TRUE(kernel.ok());
    FakeTools tools;
    DaemonProcess daemon(c.env, tools.dir());

    // Every last line ends in a newline.
    ASSERT_TRUE(daemon.wait_for(c.expected.back().substr(2) + "\n", 20000ms)) << daemon.output();
    if (c.env.empty()) {
      ASSERT_TRUE(tools.wait_for_calls(1, 5000));
      EXPECT_EQ(tools.calls(), Lines{"diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o "
                                     "/data/log -n 3 -s 1 -c"});
      EXPECT_EQ(boot_lines(daemon), c.expected);
      continue;
    }
    // The state is still 0: a dump finds logging disabled, and the tool never ran.
    ASSERT_TRUE(kernel.send(command_frame(27, {0, 0})));
    ASSERT_TRUE(daemon.wait_for("diag : Diabled Logging System\n", 5000ms)) << daemon.output();
    EXPECT_EQ(boot_lines(daemon), c.expected + Lines{"I diag : Diabled Logging System"});
    EXPECT_TRUE(tools.calls().empty());
  }
}

}  // namespace
