// Command 27 on the main thread against the dump threads it starts: a stop that lands in the
// middle of a dump, and dumps asked for again and again while one runs.
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <thread>

#include "daemon_fixture.h"
#include "daemon_process.h"
#include "diag/diag_logging.h"

namespace {

using Lines = std::vector<std::string>;

const char kStart[] = "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c";
const char kStop[] = "diag_mdlog -k -p 16";

Lines operator+(Lines a, const Lines& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// The lines of the DIAG functions and every libdiag call, in the order they were logged.
Lines diag_lines(const LogCapture& log) {
  Lines out;
  for (const LogRecord& r : log.records()) {
    if (r.tag == "libdiag") out.push_back("libdiag: " + r.message);
    if (r.tag != "KESTRELD") continue;
    for (const char* prefix : {"diag_logging", "check_", "sns_set_diag", "send_dumpstate"}) {
      if (r.message.rfind(prefix, 0) == 0) out.push_back(r.message);
    }
  }
  return out;
}

Lines mode_lines(int mode) {
  return {"libdiag: Diag_LSM_Init ok",
          "sns_set_diag_mode: diag_configure_peripheral_buffering_tx_mode Enter\n",
          "libdiag: diag_configure_peripheral_buffering_tx_mode 3 " + std::to_string(mode) +
              " 1 90 -> 1",
          "libdiag: Diag_LSM_DeInit"};
}

const Lines kDump = Lines{"diag_logging_thread start\n"} + mode_lines(0) +
                    Lines{"check_property Success\n", "check_files is not exist -1\n"} +
                    mode_lines(2) + Lines{"sns_set_diag_tx_mode: diag_mdlog Enter 1\n"};

class DiagRaceTest : public DaemonFixture {
 protected:
  void SetUp() override {
    DaemonFixture::SetUp();
    static const std::string path = getenv("PATH");
    setenv("PATH", (tools.dir() + ":" + path).c_str(), 1);
    write_file(test_properties_path(), "");
    remove_file(test_sysroot() + "/data/misc/radio/uart.txt");
  }

  FakeTools tools;
};

TEST_F(DiagRaceTest, StopDuringDumpEndsItWithoutRestart) {
  // The first stop command holds its caller, the dump thread, until the test releases it. It
  // claims the hold before its call is recorded, so a recorded call means the hold is taken.
  const std::string dir = tools.dir();
  ASSERT_EQ(rename((dir + "/diag_mdlog").c_str(), (dir + "/recorded").c_str()), 0);
  write_file(dir + "/diag_mdlog",
             "#!/bin/sh\nD='" + dir +
                 "'\nheld=\n"
                 "if [ \"$1\" = -k ] && rmdir \"$D/hold\" 2>/dev/null; then held=1; fi\n"
                 "\"$D/recorded\" \"$@\"\n"
                 "n=0\n"
                 "while [ -n \"$held\" ] && [ ! -e \"$D/release\" ] && [ $n -lt 3000 ]; do\n"
                 "  sleep 0.01; n=$((n + 1))\n"
                 "done\n");
  ASSERT_EQ(chmod((dir + "/diag_mdlog").c_str(), 0755), 0);
  ASSERT_EQ(mkdir((dir + "/hold").c_str(), 0755), 0);
  set_diag_logging_state(1);

  command(27, {0, 0});
  ASSERT_TRUE(tools.wait_for_calls(1, 5000));
  // The dump thread is inside its stop command: mode 0 set, nothing checked yet.
  const Lines at_stop = Lines{"diag_logging_thread start\n"} + mode_lines(0);
  EXPECT_EQ(diag_lines(*log), at_stop);
  EXPECT_EQ(diag_logging_state(), 3);

  command(27, {0, 1});
  EXPECT_EQ(diag_logging_state(), 0);
  write_file(dir + "/release", "");

  // After its pause the dump finds logging stopped and starts nothing.
  EXPECT_FALSE(log->wait_for("check_property Success\n", scaled(20000ms)));
  EXPECT_EQ(diag_lines(*log), at_stop);
  EXPECT_EQ(diag_logging_state(), 0);
  EXPECT_EQ(tools.calls(), (Lines{kStop, kStop}));
}

TEST_F(DiagRaceTest, DumpsAskedForWhileOneRunsNeverOverlap) {
  set_diag_logging_state(1);
  size_t commands = 0;
  while (log->count("diag : To start logging 3\n") < 3 && commands < 2000) {
    command(27, {0, 0});
    ++commands;
    std::this_thread::sleep_for(2ms);
  }
  for (int i = 0; i < 4000 && diag_logging_state() != 1; ++i) std::this_thread::sleep_for(5ms);
  ASSERT_EQ(diag_logging_state(), 1);

  // Every command found logging either idle (and started a dump) or a dump running.
  EXPECT_EQ(log->count("diag : To start logging 3\n"), 3u);
  EXPECT_EQ(log->count("diag : Logging System is running\n"), commands - 3);
  EXPECT_EQ(diag_lines(*log), kDump + kDump + kDump);
  ASSERT_TRUE(tools.wait_for_calls(6, 5000));
  EXPECT_EQ(tools.calls(), (Lines{kStop, kStart, kStop, kStart, kStop, kStart}));
}

}  // namespace
