// SPDX-License-Identifier: Apache-2.0
// Shared main of the test binaries: the environment first, then GoogleTest.
#include <gmock/gmock.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>

int main(int argc, char** argv) {
  const std::string base = "/tmp/kestrel-test-" + std::to_string(getpid());
  setenv("KESTREL_SENSOR1_SOCKET", (base + ".sock").c_str(), 0);
  setenv("KESTREL_PROPERTIES", (base + ".props").c_str(), 0);
  setenv("KESTREL_SENSOR_REG", (base + ".reg").c_str(), 0);
  setenv("KESTREL_SYSROOT", (base + "-root").c_str(), 0);
  setenv("KESTREL_KERNEL_PORT", "100", 0);
  setenv("KESTREL_TIME_SCALE", "0.05", 0);
  signal(SIGPIPE, SIG_IGN);
  testing::InitGoogleMock(&argc, argv);
  const int r = RUN_ALL_TESTS();
  const std::string cleanup =
      "rm -rf " + base + ".sock " + base + ".props " + base + ".reg " + base + "-root";
  int ignored = system(cleanup.c_str());
  (void)ignored;
  return r;
}
