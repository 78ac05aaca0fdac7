// SPDX-License-Identifier: Apache-2.0
// What the DIAG tests share: the two tool calls, the log lines of a transmit-mode change and of
// passed checks, a view of the DIAG records, and the in-process fixture (recording tools first on
// PATH, no properties, no UART selection file).
#pragma once

#include <stdlib.h>

#include <string>
#include <thread>
#include <vector>

#include "daemon_fixture.h"
#include "diag/diag_logging.h"

// "<priority letter> <message>" of every libdiag call ("I libdiag: ...") unless left out, and of
// the daemon's records that start with one of prefixes, in the order they were logged.
inline Lines view(const std::vector<LogRecord>& records,
                  const Lines& prefixes = {"diag_logging", "check_", "sns_set_diag",
                                           "send_dumpstate"},
                  bool with_libdiag = true) {
  Lines out;
  for (const LogRecord& r : records) {
    const std::string p = r.letter();
    if (r.tag == "libdiag" && with_libdiag) out.push_back(p + "libdiag: " + r.message);
    for (const std::string& prefix : prefixes) {
      if (r.tag == "KESTRELD" && r.message.rfind(prefix, 0) == 0) {
        out.push_back(p + r.message);
        break;
      }
    }
  }
  return out;
}

// One transmit-mode change: 0 before a dump, 2 before logging starts.
inline Lines mode_lines(int mode) {
  return {"I libdiag: Diag_LSM_Init ok",
          "E sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
          "I libdiag: diag_configure_peripheral_buffering_tx_mode 3 " + std::to_string(mode) +
              " 1 90 -> 1",
          "I libdiag: Diag_LSM_DeInit"};
}

inline const Lines kChecksPass = {"I check_property Success\n", "I check_files is not exist -1\n"};
inline const Lines kStarted = mode_lines(2) + Lines{"I sns_set_diag_tx_mode: diag_mdlog Enter 1\n"};

class DiagTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    use_tools(tools);
    write_file(test_properties_path(), "");
    remove_file(uart_path());
  }
  static std::string uart_path() { return test_sysroot() + "/data/misc/radio/uart.txt"; }
  static void use_tools(const FakeTools& t) {
    static const std::string path = getenv("PATH");
    setenv("PATH", (t.dir() + ":" + path).c_str(), 1);
  }
  // The dump thread sets the state last, right before it ends.
  static bool wait_for_state(diag_state value) {
    return eventually([=] { return diag_logging_state() == value; }, 20000ms);
  }

  FakeTools tools;
};
