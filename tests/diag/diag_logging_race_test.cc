// SPDX-License-Identifier: Apache-2.0
// Command 27 on the main thread against the dump threads it starts: a stop that lands in the
// middle of a dump, and dumps asked for again and again while one runs.
#include <stdio.h>
#include <sys/stat.h>

#include <thread>

#include "diag_fixture.h"

namespace {

TEST_F(DiagTest, StopDuringDumpEndsItWithoutRestart) {
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
  set_diag_logging_state(diag_state::logging);

  command(27, {0, 0});
  ASSERT_TRUE(tools.wait_for_calls(1, 5000));
  // The dump thread is inside its stop command: mode 0 set, nothing checked yet.
  const Lines at_stop = Lines{"I diag_logging_thread start\n"} + mode_lines(0);
  EXPECT_EQ(view(log->records()), at_stop);
  EXPECT_EQ(diag_logging_state(), diag_state::dumping);

  command(27, {0, 1});
  EXPECT_EQ(diag_logging_state(), diag_state::stopped);
  write_file(dir + "/release", "");

  // After its pause the dump finds logging stopped and starts nothing.
  EXPECT_FALSE(log->wait_for("check_property Success\n", scaled(20000ms)));
  EXPECT_EQ(view(log->records()), at_stop);
  EXPECT_EQ(diag_logging_state(), diag_state::stopped);
  EXPECT_EQ(tools.calls(), (Lines{kStop, kStop}));
}

TEST_F(DiagTest, DumpsAskedForWhileOneRunsNeverOverlap) {
  set_diag_logging_state(diag_state::logging);
  size_t commands = 0;
  while (log->count("diag : To start logging 3\n") < 3 && commands < 2000) {
    command(27, {0, 0});
    ++commands;
    std::this_thread::sleep_for(2ms);
  }
  ASSERT_TRUE(wait_for_state(diag_state::logging));

  // Every command found logging either idle (and started a dump) or a dump running.
  EXPECT_EQ(log->count("diag : To start logging 3\n"), 3u);
  EXPECT_EQ(log->count("diag : Logging System is running\n"), commands - 3);
  const Lines dump =
      Lines{"I diag_logging_thread start\n"} + mode_lines(0) + kChecksPass + kStarted;
  EXPECT_EQ(view(log->records()), dump + dump + dump);
  ASSERT_TRUE(tools.wait_for_calls(6, 5000));
  EXPECT_EQ(tools.calls(), (Lines{kStop, kStart, kStop, kStart, kStop, kStart}));
}

}  // namespace
