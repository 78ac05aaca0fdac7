// SPDX-License-Identifier: Apache-2.0
#include "fuzz_support.h"

#include <android/log.h>
#include <fcntl.h>
#include <ftw.h>
#include <linux/netlink.h>
#include <pthread.h>
#include <sched.h>
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#include <atomic>
#include <climits>
#include <memory>

#include "byte_order.h"
#include "diag/diag_logging.h"
#include "kernel_channel/netlink_channel.h"
#include "requests/raw_data.h"
#include "sensor1_host.h"
#include "service_link/connection.h"
#include "service_link/factory_state.h"
#include "service_link/response_waiter.h"
#include "service_link/service_callback.h"
#include "tools/sim/simulator.h"

namespace kestrel_fuzz {

const char kNormalProperties[] =
    "# a phone on the factory line\n"
    "persist.sys.usb.q_config=mtp,adb\n"
    "ro.debug_level=0x494d\n";

const char kCalibratedRegistry[] =
    "0 = 03\n1 = fe\n2 = 12\n"
    "300 = 01\n301 = 00\n302 = fd\n"
    "406 = 4a 27 00 00\n407 = 9c ff ff ff\n408 = 0c 00 00 00\n"
    "409 = a0 ff ff ff\n410 = e2 26 00 00\n411 = 1e 00 00 00\n"
    "412 = f6 ff ff ff\n413 = 28 00 00 00\n414 = 35 27 00 00\n"
    "102 = 2c 01\n119 = 20 03\n120 = 58 02\n123 = 01\n124 = 0e 00 00 00\n"
    "125 = b8 0b\n126 = d0 07\n";

namespace {

constexpr uint32_t kKernelPort = 100;
constexpr uint32_t kDaemonPort = 20000;
constexpr size_t kHeaderSize = 16;

fuzz_paths g_paths;
kestrel_sim::Simulator* g_phone = nullptr;
bool g_print_log = false;
std::atomic<int> g_daemon_threads{0};
std::atomic<int> g_failing_block{0};
std::atomic<int> g_block_position{0};

// Payload bytes of every frame type the daemon may send; -1 for the types it never sends.
int payload_length(uint16_t type) {
  switch (type) {
    case 0:
      return 2;
    case 2:
      return 16;
    case 3:
      return 8;
    case 5:
      return 44;
    case 7:
      return 8;
    case 9:
      return 72;
    case 10:
    case 14:
      return 60;
    case 11:
    case 12:
      return 36;
    case 15:
    case 16:
      return 12;
    case 20:
      return 129;
    case 30:
    case 33:
      return 16;
    case 34:
      return 2;
    default:
      return -1;
  }
}

void check_frame(int fd, const struct msghdr* msg) {
  if (fd != kernel_channel()) fail("frame sent on descriptor %d, not the kernel channel", fd);
  if (msg == nullptr || msg->msg_iov == nullptr || msg->msg_iovlen != 1) {
    fail("frame without exactly one vector entry");
  }
  if (msg->msg_name == nullptr || msg->msg_namelen != sizeof(struct sockaddr_nl)) {
    fail("frame without a netlink address");
  }
  struct sockaddr_nl to;
  memcpy(&to, msg->msg_name, sizeof to);
  if (to.nl_family != AF_NETLINK || to.nl_pid != kKernelPort || to.nl_groups != 0) {
    fail("frame addressed to family %u port %u groups %u", to.nl_family, to.nl_pid, to.nl_groups);
  }
  const auto* frame = static_cast<const uint8_t*>(msg->msg_iov->iov_base);
  const size_t size = msg->msg_iov->iov_len;
  if (frame == nullptr || size < kHeaderSize) fail("frame of %zu bytes", size);
  const uint32_t len = load_u32(frame, 0);
  const uint16_t type = load_u16(frame, 4);
  const int payload = payload_length(type);
  if (payload < 0) fail("frame of type %u, which the daemon never sends", type);
  const uint32_t expected = (static_cast<uint32_t>(payload) + kHeaderSize + 3) & ~3u;
  if (len != expected || size != expected) {
    fail("frame type %u: nlmsg_len %u, buffer %zu, expected %u", type, len, size, expected);
  }
  if (load_u16(frame, 6) != 0 || load_u32(frame, 8) != 0 || load_u32(frame, 12) != kDaemonPort) {
    fail("frame type %u: flags, seq or pid wrong", type);
  }
  for (size_t i = kHeaderSize + static_cast<size_t>(payload); i < size; ++i) {
    if (frame[i] != 0) fail("frame type %u: alignment byte %zu is 0x%02x", type, i, frame[i]);
  }
  if (type == 34 && (frame[16] != 0x04 || frame[17] != 0x01)) {
    fail("frame type 34 carries %02x %02x, not 04 01", frame[16], frame[17]);
  }
}

void* failing_malloc(size_t size) {
  const int block = g_block_position.fetch_add(1) % 4 + 1;
  if (block == 4) g_block_position.store(0);
  if (block == g_failing_block.load()) {
    // The allocation of this frame ends here: the next frame starts again at block 1.
    g_block_position.store(0);
    return nullptr;
  }
  return malloc(size);
}

// A thread of the daemon: its entry and argument, run by the trampoline below.
struct daemon_thread {
  void* (*entry)(void*);
  void* arg;
};

void* run_daemon_thread(void* p) {
  const daemon_thread t = *static_cast<daemon_thread*>(p);
  delete static_cast<daemon_thread*>(p);
  void* result = t.entry(t.arg);
  g_daemon_threads.fetch_sub(1);
  return result;
}

int remove_entry(const char* path, const struct stat*, int, struct FTW*) {
  return remove(path);
}

void remove_root() {
  if (!g_paths.root.empty()) nftw(g_paths.root.c_str(), remove_entry, 8, FTW_DEPTH | FTW_PHYS);
}

}  // namespace

void fail(const char* format, ...) {
  va_list args;
  va_start(args, format);
  fprintf(stderr, "kestrel fuzz check failed: ");
  vfprintf(stderr, format, args);
  fprintf(stderr, "\n");
  va_end(args);
  abort();
}

void write_file(const std::string& path, const void* data, size_t size) {
  const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) fail("cannot write %s", path.c_str());
  const auto* p = static_cast<const uint8_t*>(data);
  while (size > 0) {
    const ssize_t n = write(fd, p, size);
    if (n <= 0) fail("cannot write %s", path.c_str());
    p += n;
    size -= static_cast<size_t>(n);
  }
  close(fd);
}

const fuzz_paths& setup_fuzz_environment(const std::string& properties,
                                         const std::string& registry) {
  const char* tmp = getenv("TMPDIR");
  std::string pattern =
      std::string(tmp != nullptr && tmp[0] != '\0' ? tmp : "/tmp") + "/kestrel-fuzz-XXXXXX";
  if (mkdtemp(&pattern[0]) == nullptr) fail("cannot create a temporary directory");
  g_paths.root = pattern;
  g_paths.properties = pattern + "/properties";
  g_paths.registry = pattern + "/sensor_reg.txt";
  const std::string radio = pattern + "/data/misc/radio";
  mkdir((pattern + "/data").c_str(), 0755);
  mkdir((pattern + "/data/misc").c_str(), 0755);
  mkdir(radio.c_str(), 0755);
  g_paths.uart = radio + "/uart.txt";
  write_file(g_paths.properties, properties.data(), properties.size());
  write_file(g_paths.registry, registry.data(), registry.size());
  atexit(remove_root);

  setenv("KESTREL_TIME_SCALE", "0", 1);
  setenv("KESTREL_KERNEL_PORT", "100", 1);
  setenv("KESTREL_PROPERTIES", g_paths.properties.c_str(), 1);
  setenv("KESTREL_SENSOR_REG", g_paths.registry.c_str(), 1);
  setenv("KESTREL_SYSROOT", g_paths.root.c_str(), 1);
  setenv("KESTREL_SENSOR1_SOCKET", (pattern + "/sensor1.sock").c_str(), 1);
  setenv("KESTREL_SENSOR1_INIT_RESULT", "0", 1);
  setenv("KESTREL_DIAG_INIT", "ok", 1);
  setenv("KESTREL_DIAG_TX_MODE_RESULT", "1", 1);
  const char* log = getenv("KESTREL_FUZZ_LOG");
  g_print_log = log != nullptr && strcmp(log, "1") == 0;

  // As main does before any thread starts. The channel is a descriptor on which a real sendmsg
  // would fail at once; the wrapped sendmsg below never passes a frame on.
  init_callback_locks();
  init_response_waiters();
  set_kernel_channel(open("/dev/null", O_WRONLY | O_CLOEXEC));
  // Lives as long as the process: the daemon's connections reach it to the end.
  g_phone = new kestrel_sim::Simulator(kestrel_sim::Simulator::InProcess{}, true);
  g_phone->phone().set_bad_request_hook([](const std::string& line) { fail("%s", line.c_str()); });
  return g_paths;
}

void set_phone_scenario(const phone_scenario& scenario) {
  g_phone->clear_requests();
  g_phone->refuse_opens(SENSOR1_EWOULDBLOCK, scenario.open_fails ? INT_MAX : 0);
  g_phone->phone().set_knobs(scenario.knobs);
  g_phone->set_connection_hook([scenario](kestrel_sim::Simulator& sim, int, bool opened) {
    if (opened && scenario.alloc_result != 0) {
      sim.fault(kestrel_sim::FaultOp::kAlloc, scenario.alloc_result, UINT32_MAX);
    }
    if (opened && scenario.write_result != 0) {
      sim.fault(kestrel_sim::FaultOp::kWrite, scenario.write_result, UINT32_MAX);
    }
  });
}

void check_bodies_released() {
  if (sensor1_host_outstanding_bodies() != 0) {
    fail("%ld sensor1 bodies not released", sensor1_host_outstanding_bodies());
  }
}

void reset_daemon_state(diag_state diag) {
  reset_connection_for_testing();
  reset_response_waiters_for_testing();
  reset_factory_state_for_testing();
  reset_raw_data_flags_for_testing();
  set_diag_logging_state(diag);
  fail_frame_block(0);
}

diag_state diag_state_of_bits(uint32_t bits) {
  static const diag_state kStates[4] = {diag_state::stopped, diag_state::logging,
                                        diag_state::dumping, diag_state::stopped};
  return kStates[bits & 3];
}

void wait_for_daemon_threads() {
  while (g_daemon_threads.load() != 0) sched_yield();
}

void fail_frame_block(int block) {
  g_failing_block.store(block);
  g_block_position.store(0);
  set_netmgr_malloc_for_testing(block == 0 ? nullptr : failing_malloc);
}

}  // namespace kestrel_fuzz

using kestrel_fuzz::fail;

extern "C" {

// The shell: only the commands the daemon issues are accepted, and none of them is run.
int system(const char* command) {
  static const char* const kKnown[] = {
      "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c&",
      "diag_mdlog -k -p 16",
      "chown system:radio /efs/FactoryApp/predefine*",
      "chown system:radio /efs/FactoryApp/hh_version",
      "chmod 660 /efs/FactoryApp/predefine*",
      "chmod 660 /efs/FactoryApp/hh_version",
  };
  if (command == nullptr) fail("system(NULL)");
  for (const char* known : kKnown) {
    if (strcmp(command, known) == 0) {
      if (kestrel_fuzz::g_print_log) fprintf(stderr, "system: %s\n", command);
      return 0;
    }
  }
  fail("shell command the daemon never runs: \"%s\"", command);
}

int __android_log_print(int prio, const char* tag, const char* fmt, ...) {
  if (tag == nullptr || fmt == nullptr) fail("log line without a tag or a format");
  if (strcmp(tag, "KESTRELD") == 0 && prio != ANDROID_LOG_INFO && prio != ANDROID_LOG_WARN &&
      prio != ANDROID_LOG_ERROR) {
    fail("daemon log line of priority %d: %s", prio, fmt);
  }
  char line[2048];
  va_list args;
  va_start(args, fmt);
  const int n = vsnprintf(line, sizeof line, fmt, args);
  va_end(args);
  if (kestrel_fuzz::g_print_log) fprintf(stderr, "%s %d %s\n", tag, prio, line);
  return n;
}

int __real_pthread_create(pthread_t* thread, const pthread_attr_t* attr, void* (*entry)(void*),
                          void* arg);

int __wrap_pthread_create(pthread_t* thread, const pthread_attr_t* attr, void* (*entry)(void*),
                          void* arg) {
  auto* t = new kestrel_fuzz::daemon_thread{entry, arg};
  kestrel_fuzz::g_daemon_threads.fetch_add(1);
  const int r = __real_pthread_create(thread, attr, kestrel_fuzz::run_daemon_thread, t);
  if (r != 0) {
    kestrel_fuzz::g_daemon_threads.fetch_sub(1);
    delete t;
  }
  return r;
}

ssize_t __wrap_sendmsg(int fd, const struct msghdr* msg, int /*flags*/) {
  kestrel_fuzz::check_frame(fd, msg);
  return static_cast<ssize_t>(msg->msg_iov->iov_len);
}

}  // extern "C"
