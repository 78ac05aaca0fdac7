// SPDX-License-Identifier: Apache-2.0
// The environment every test binary runs in. test_main sets it before anything reads it, so
// in-process code and the daemons a test starts see the same files:
//   KESTREL_SENSOR1_SOCKET, KESTREL_PROPERTIES, KESTREL_SENSOR_REG and KESTREL_SYSROOT name
//   files and a directory private to this test process; KESTREL_KERNEL_PORT is 100 and
//   KESTREL_TIME_SCALE 0.05 unless the test's command line environment sets it.
#pragma once

#include <chrono>
#include <functional>
#include <string>
#include <vector>

std::string test_socket_path();
std::string test_properties_path();
std::string test_registry_path();
std::string test_sysroot();

// A nominal duration at the time scale the tests run the daemon at (KESTREL_TIME_SCALE).
std::chrono::milliseconds scaled(std::chrono::milliseconds nominal);

// Polls done every 2 ms until it holds (true) or timeout has passed (false); done runs at least
// once.
[[nodiscard]] bool eventually(const std::function<bool()>& done,
                              std::chrono::milliseconds timeout = std::chrono::seconds(5));

// Writes a whole file (the parent directories are created).
void write_file(const std::string& path, const std::string& text);
void remove_file(const std::string& path);
// A whole file's text ("" when it cannot be read).
std::string read_file(const std::string& path);

// Recording stand-ins for the shell tools the daemon runs: chown, chmod and diag_mdlog. Each
// call appends "<tool> <args>" as one line to a record file. Put dir() first on PATH.
class FakeTools {
 public:
  FakeTools();
  ~FakeTools();
  const std::string& dir() const { return dir_; }
  std::vector<std::string> calls() const;
  // Waits until at least n calls are recorded.
  bool wait_for_calls(size_t n, int timeout_ms) const;

 private:
  std::string dir_;
};

// The tool calls that start and stop DIAG logging.
inline const std::string kStart =
    "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c";
inline const std::string kStop = "diag_mdlog -k -p 16";
