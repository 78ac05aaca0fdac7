// SPDX-License-Identifier: Apache-2.0
// Command 36: the four shell commands that repair the owner and mode of the light sensor's
// coefficient files, each finished before the next, all between the two log lines.
#include <android/log.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <mutex>
#include <string>
#include <vector>

#include "tests/diag/diag_fixture.h"

using ::testing::ElementsAre;

namespace {

// Each log line together with the number of shell calls recorded at the moment it was logged.
FakeTools* g_tools = nullptr;
std::mutex g_mutex;
std::vector<std::pair<std::string, size_t>> g_lines;

void recording_logger(const struct __android_logger_data* data, const char* message) {
  if (std::string(data->tag) != "KESTRELD") return;
  std::lock_guard<std::mutex> lock(g_mutex);
  g_lines.emplace_back(message, g_tools->calls().size());
}

// On the fixture whose recording tools are first on PATH.
using HhFilePermissionsTest = DiagTest;

TEST_F(HhFilePermissionsTest, RunsTheFourCommandsInOrderBetweenItsLines) {
  g_tools = &tools;
  __android_log_set_logger(recording_logger);
  command(36);

  __android_log_set_logger(__android_log_stderr_logger);
  EXPECT_THAT(tools.calls(), ElementsAre("chown system:radio /efs/FactoryApp/predefine*",
                                         "chown system:radio /efs/FactoryApp/hh_version",
                                         "chmod 660 /efs/FactoryApp/predefine*",
                                         "chmod 660 /efs/FactoryApp/hh_version"));
  using Line = std::pair<std::string, size_t>;
  EXPECT_THAT(g_lines, ElementsAre(Line{"process_message: 36", 0}, Line{"chown : start \n", 0},
                                   Line{"chown : end\n", 4}));
}

}  // namespace
