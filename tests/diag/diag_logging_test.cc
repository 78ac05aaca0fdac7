// SPDX-License-Identifier: Apache-2.0
// DIAG logging control inside one process: whether logging may start, the start thread, and
// command 27 with the dump thread it starts.
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <optional>
#include <thread>
#include <tuple>

#include "diag_fixture.h"
#include "service_link/connection.h"

namespace {

TEST_F(DiagTest, UsbConfigAndUartFileDecideWhetherLoggingStarts) {
  struct Case {
    const char* q_config;
    const char* uart;  // null: no file; "/": a directory in its place; "=": a socket
    Lines expected;
  };
  const Lines diag_mode = {"I check_property is Diag Mode\n",
                           "I sns_set_diag_tx_mode: DM mode is setting\n"};
  const Lines dm = {"I sns_set_diag_tx_mode: DM mode is setting\n"};
  const Case cases[] = {
      // DIAG in the USB configuration: the UART file is not even looked at.
      {"diag", "AP", diag_mode},
      {"mtp,diag,adb", "AP", diag_mode},
      {"mtp,adb", "CP\n",
       Lines{"I check_property Success\n", "I check_files is Diag Mode CP\n"} + dm},
      {"mtp,adb", "/", Lines{"I check_property Success\n", "E check_files read fails"} + dm},
      {"mtp,adb", "=", Lines{"I check_property Success\n", "E check_files open error 6"} + dm},
      // Only the first two bytes count.
      {"", "APCP", Lines{"I check_property Success\n", "I check_files is AP Mode AP\n"} + kStarted},
      {"", "", Lines{"I check_property Success\n", "I check_files is AP Mode \n"} + kStarted},
      {"mtp", nullptr, kChecksPass + kStarted},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.q_config) + " / " + (c.uart != nullptr ? c.uart : "no file"));
    FakeTools case_tools;
    use_tools(case_tools);
    write_file(test_properties_path(), std::string("persist.sys.usb.q_config=") + c.q_config);
    rmdir(uart_path().c_str());
    remove_file(uart_path());
    if (c.uart != nullptr && std::string(c.uart) == "/") {
      ASSERT_EQ(mkdir(uart_path().c_str(), 0755), 0);
    } else if (c.uart != nullptr && std::string(c.uart) == "=") {
      const int s = socket(AF_UNIX, SOCK_STREAM, 0);  // opening it fails with ENXIO
      struct sockaddr_un addr = {};
      addr.sun_family = AF_UNIX;
      snprintf(addr.sun_path, sizeof addr.sun_path, "%s", uart_path().c_str());
      ASSERT_EQ(bind(s, reinterpret_cast<struct sockaddr*>(&addr), sizeof addr), 0);
      close(s);
    } else if (c.uart != nullptr) {
      write_file(uart_path(), c.uart);
    }
    set_diag_logging_state(diag_state::dumping);
    log->clear();

    sns_set_diag_tx_mode();

    EXPECT_EQ(view(log->records()), c.expected);
    const bool started = c.expected.back() == kStarted.back();
    EXPECT_EQ(diag_logging_state(), started ? diag_state::logging : diag_state::stopped);
    EXPECT_TRUE(!started || case_tools.wait_for_calls(1, 5000));
    EXPECT_EQ(case_tools.calls(), started ? Lines{kStart} : Lines{});
  }
  rmdir(uart_path().c_str());
}

TEST_F(DiagTest, DebugLevelEndsStartThreadBeforeTheServiceIsOpened) {
  write_file(test_properties_path(), "ro.debug_level=0x4f4c\n");
  set_diag_logging_state(diag_state::logging);
  std::thread(diag_logging_start_thread, nullptr).join();

  EXPECT_EQ(view(log->records()),
            (Lines{"I diag_logging_start_thread start\n", "I check_loglevel stop logging\n"}));
  EXPECT_EQ(diag_logging_state(), diag_state::stopped);
  EXPECT_EQ(open_retry_budget(), kOpenRetryBudget);
  EXPECT_EQ(sim->opened_connections(), 0);
  EXPECT_TRUE(tools.calls().empty());
}

TEST_F(DiagTest, StartThreadOpensTheServiceThenStartsLogging) {
  write_file(test_properties_path(), "ro.debug_level=0x494d\n");
  std::thread(diag_logging_start_thread, nullptr).join();

  EXPECT_EQ(sim->opened_connections(), 1);
  EXPECT_EQ(
      view(log->records(), {"sensor1_open_or_reopen", "diag_logging", "check_", "sns_set_diag"}),
      (Lines{"I diag_logging_start_thread start\n",
             "I sensor1_open_or_reopen: sensor1_open success\n"} +
       kChecksPass + kStarted));
  EXPECT_EQ(diag_logging_state(), diag_state::logging);
  ASSERT_TRUE(tools.wait_for_calls(1, 5000));
  EXPECT_EQ(tools.calls(), Lines{kStart});
}

TEST_F(DiagTest, DumpStopsAndRestartsLogging) {
  set_diag_logging_state(diag_state::logging);
  command(27, {0, 0});

  // The dispatcher's own lines; the dump thread's are checked below.
  EXPECT_EQ(
      view(log->records(), {"diag :", "process_message: 27", "process_message: logging"}, false),
      (Lines{"I process_message: 27", "I diag : debugging_mode 1\n",
             "I diag : To start logging 3\n", "I process_message: logging_thread_handle success \n",
             "E diag : To stop logging 3\n"}));

  // The stop command has run to its end before the checks of the restart.
  ASSERT_TRUE(log->wait_for("check_property Success\n", 5000ms));
  const Lines at_checks = tools.calls();
  ASSERT_FALSE(at_checks.empty());
  EXPECT_EQ(at_checks[0], kStop);

  ASSERT_TRUE(wait_for_state(diag_state::logging));
  EXPECT_EQ(view(log->records()),
            Lines{"I diag_logging_thread start\n"} + mode_lines(0) + kChecksPass + kStarted);
  ASSERT_TRUE(tools.wait_for_calls(2, 5000));
  EXPECT_EQ(tools.calls(), (Lines{kStop, kStart}));
}

}  // namespace
