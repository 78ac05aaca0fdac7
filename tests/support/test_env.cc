// SPDX-License-Identifier: Apache-2.0
#include "test_env.h"

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <fstream>
#include <sstream>
#include <thread>

namespace {

void make_dirs(const std::string& path) {
  for (size_t i = 1; i < path.size(); ++i) {
    if (path[i] == '/') mkdir(path.substr(0, i).c_str(), 0755);
  }
}

}  // namespace

std::string test_socket_path() {
  return getenv("KESTREL_SENSOR1_SOCKET");
}
std::string test_properties_path() {
  return getenv("KESTREL_PROPERTIES");
}
std::string test_registry_path() {
  return getenv("KESTREL_SENSOR_REG");
}
std::string test_sysroot() {
  return getenv("KESTREL_SYSROOT");
}

std::chrono::milliseconds scaled(std::chrono::milliseconds nominal) {
  return std::chrono::milliseconds(
      static_cast<long>(static_cast<double>(nominal.count()) * atof(getenv("KESTREL_TIME_SCALE"))));
}

void write_file(const std::string& path, const std::string& text) {
  make_dirs(path);
  std::ofstream(path, std::ios::trunc) << text;
}

void remove_file(const std::string& path) {
  unlink(path.c_str());
}

std::string read_file(const std::string& path) {
  std::ifstream in(path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

FakeTools::FakeTools() {
  char tmpl[] = "/tmp/kestrel-tools-XXXXXX";
  dir_ = mkdtemp(tmpl);
  for (const char* tool : {"chown", "chmod", "diag_mdlog"}) {
    const std::string path = dir_ + "/" + tool;
    write_file(path,
               "#!/bin/sh\necho \"" + std::string(tool) + " $*\" >> \"" + dir_ + "/calls\"\n");
    chmod(path.c_str(), 0755);
  }
}

FakeTools::~FakeTools() {
  std::string cmd = "rm -rf '" + dir_ + "'";
  int r = system(cmd.c_str());
  (void)r;
}

std::vector<std::string> FakeTools::calls() const {
  std::vector<std::string> out;
  std::ifstream in(dir_ + "/calls");
  std::string line;
  while (std::getline(in, line)) out.push_back(line);
  return out;
}

bool eventually(const std::function<bool()>& done, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!done()) {
    if (std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  return true;
}

bool FakeTools::wait_for_calls(size_t n, int timeout_ms) const {
  return eventually([&] { return calls().size() >= n; }, std::chrono::milliseconds(timeout_ms));
}
