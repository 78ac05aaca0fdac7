// DIAG logging control inside one process: whether logging may start, the start thread, and
// command 27 with the dump thread it starts.
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <thread>

#include "daemon_fixture.h"
#include "diag/diag_logging.h"
#include "service_link/connection.h"

namespace {

using Lines = std::vector<std::string>;

const char kStart[] = "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c";
const char kStop[] = "diag_mdlog -k -p 16";

Lines operator+(Lines a, const Lines& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// "<priority letter> <message>" of the daemon's lines that start with one of prefixes, and of
// every libdiag call ("I libdiag: ...") unless left out, in the order they were logged.
Lines view(const LogCapture& log, const std::vector<std::string>& prefixes,
           bool with_libdiag = true) {
  Lines out;
  for (const LogRecord& r : log.records()) {
    const std::string p(1, "??VDIWEF"[r.priority & 7]);
    if (r.tag == "libdiag" && with_libdiag) out.push_back(p + " libdiag: " + r.message);
    if (r.tag != "KESTRELD") continue;
    for (const std::string& prefix : prefixes) {
      if (r.message.compare(0, prefix.size(), prefix) == 0) {
        out.push_back(p + " " + r.message);
        break;
      }
    }
  }
  return out;
}

Lines diag_lines(const LogCapture& log) {
  return view(log, {"diag_logging", "check_", "sns_set_diag", "send_dumpstate"});
}

Lines mode_lines(int mode) {
  return {"I libdiag: Diag_LSM_Init ok",
          "E sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
          "I libdiag: diag_configure_peripheral_buffering_tx_mode 3 " + std::to_string(mode) +
              " 1 90 -> 1",
          "I libdiag: Diag_LSM_DeInit"};
}

const Lines kChecksPass = {"I check_property Success\n", "I check_files is not exist -1\n"};
const Lines kStarted = mode_lines(2) + Lines{"I sns_set_diag_tx_mode: diag_mdlog Enter 1\n"};
const Lines kDmMode = {"I sns_set_diag_tx_mode: DM mode is setting\n"};

std::string uart_path() {
  return test_sysroot() + "/data/misc/radio/uart.txt";
}

void use_tools(const FakeTools& tools) {
  static const std::string path = getenv("PATH");
  setenv("PATH", (tools.dir() + ":" + path).c_str(), 1);
}

class DiagTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    use_tools(tools);
    write_file(test_properties_path(), "");
    remove_file(uart_path());
  }

  // The dump thread sets the state last, right before it ends.
  static bool wait_for_state(int32_t value) {
    for (int i = 0; i < 4000 && diag_logging_state() != value; ++i) {
      std::this_thread::sleep_for(5ms);
    }
    return diag_logging_state() == value;
  }

  FakeTools tools;
};

TEST_F(DiagTest, UsbConfigAndUartFileDecideWhetherLoggingStarts) {
  struct Case {
    const char* q_config;
    const char* uart;  // null: no file; "/": a directory in its place
    Lines expected;
  };
  const Case cases[] = {
      // DIAG in the USB configuration: the UART file is not even looked at.
      {"diag", "AP", Lines{"I check_property is Diag Mode\n"} + kDmMode},
      {"mtp,diag,adb", "AP", Lines{"I check_property is Diag Mode\n"} + kDmMode},
      {"mtp,adb", "CP\n",
       Lines{"I check_property Success\n", "I check_files is Diag Mode CP\n"} + kDmMode},
      {"mtp,adb", "/", Lines{"I check_property Success\n", "E check_files read fails"} + kDmMode},
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
    } else if (c.uart != nullptr) {
      write_file(uart_path(), c.uart);
    }
    set_diag_logging_state(3);
    log->clear();

    sns_set_diag_tx_mode();

    EXPECT_EQ(diag_lines(*log), c.expected);
    const bool started = c.expected.back() == kStarted.back();
    EXPECT_EQ(diag_logging_state(), started ? 1 : 0);
    if (started) {
      EXPECT_TRUE(case_tools.wait_for_calls(1, 5000));
    }
    EXPECT_EQ(case_tools.calls(), started ? Lines{kStart} : Lines{});
  }
  rmdir(uart_path().c_str());
}

TEST_F(DiagTest, DebugLevelEndsStartThreadBeforeTheServiceIsOpened) {
  write_file(test_properties_path(), "ro.debug_level=0x4f4c\n");
  set_diag_logging_state(1);
  std::thread(diag_logging_start_thread, nullptr).join();

  EXPECT_EQ(diag_lines(*log),
            (Lines{"I diag_logging_start_thread start\n", "I check_loglevel stop logging\n"}));
  EXPECT_EQ(diag_logging_state(), 0);
  EXPECT_EQ(open_retry_budget(), kOpenRetryBudget);
  EXPECT_EQ(sim->opened_connections(), 0);
  EXPECT_TRUE(tools.calls().empty());
}

TEST_F(DiagTest, StartThreadOpensTheServiceThenStartsLogging) {
  write_file(test_properties_path(), "ro.debug_level=0x494d\n");
  std::thread(diag_logging_start_thread, nullptr).join();

  EXPECT_EQ(sim->opened_connections(), 1);
  EXPECT_EQ(view(*log, {"sensor1_open_or_reopen", "diag_logging", "check_", "sns_set_diag"}),
            (Lines{"I diag_logging_start_thread start\n",
                   "I sensor1_open_or_reopen: sensor1_open success\n"} +
             kChecksPass + kStarted));
  EXPECT_EQ(diag_logging_state(), 1);
  ASSERT_TRUE(tools.wait_for_calls(1, 5000));
  EXPECT_EQ(tools.calls(), Lines{kStart});
}

TEST_F(DiagTest, DumpStopsAndRestartsLogging) {
  set_diag_logging_state(1);
  command(27, {0, 0});

  // The dispatcher's own lines; the dump thread's are checked below.
  EXPECT_EQ(
      view(*log, {"diag :", "process_message: 27", "process_message: logging"}, false),
      (Lines{"I process_message: 27", "I diag : debugging_mode 1\n",
             "I diag : To start logging 3\n", "I process_message: logging_thread_handle success \n",
             "E diag : To stop logging 3\n"}));

  // The stop command has run to its end before the checks of the restart.
  ASSERT_TRUE(log->wait_for("check_property Success\n", 5000ms));
  const Lines at_checks = tools.calls();
  ASSERT_FALSE(at_checks.empty());
  EXPECT_EQ(at_checks[0], kStop);

  ASSERT_TRUE(wait_for_state(1));
  EXPECT_EQ(diag_lines(*log),
            Lines{"I diag_logging_thread start\n"} + mode_lines(0) + kChecksPass + kStarted);
  ASSERT_TRUE(tools.wait_for_calls(2, 5000));
  EXPECT_EQ(tools.calls(), (Lines{kStop, kStart}));
}

TEST_F(DiagTest, OtherCommand27CasesOnlyLogStopAndAskForSensorStates) {
  struct Case {
    int32_t state;
    int32_t argument;
    Lines expected;
    int32_t state_after;
    Lines calls;
  };
  const Case cases[] = {
      {3,
       0,
       {"I process_message: 27", "I diag : debugging_mode 3\n",
        "I diag : Logging System is running\n"},
       3,
       {}},
      {0, 0, {"I process_message: 27", "I diag : Diabled Logging System\n"}, 0, {}},
      {1, 2, {"I process_message: 27"}, 1, {}},
      {3, 1, {"I process_message: 27"}, 0, {kStop}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE("state " + std::to_string(c.state) + ", argument " + std::to_string(c.argument));
    FakeTools case_tools;
    use_tools(case_tools);
    set_diag_logging_state(c.state);
    log->clear();

    command(27, {0, c.argument});

    EXPECT_EQ(view(*log, {"diag", "process_message: 27", "process_message: logging", "check_",
                          "sns_set_diag"}),
              c.expected);
    EXPECT_EQ(diag_logging_state(), c.state_after);
    // A stop command has run to its end by the time the command returns.
    EXPECT_EQ(case_tools.calls(), c.calls);
    const std::optional<kestrel_sim::Request> request = sim->next_request(2000ms);
    ASSERT_TRUE(request.has_value());
    EXPECT_EQ(request->header.service, 0u);
    EXPECT_EQ(request->header.msg_id, 64);
  }
}

}  // namespace
