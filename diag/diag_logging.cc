// SPDX-License-Identifier: Apache-2.0
#include "diag_logging.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <pthread.h>
#include <string.h>
#include <sys/system_properties.h>
#include <unistd.h>

#include <atomic>

#include "diag_lsm.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"
#include "service_link/connection.h"
#include "shell_command.h"

const char kDiagMdlogStart[] =
    "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c&";
const char kDiagMdlogStop[] = "diag_mdlog -k -p 16";

namespace {

std::atomic<diag_state> diag_logging_state_value{diag_state::stopped};
static_assert(std::atomic<diag_state>::is_always_lock_free, "the state is one plain 32-bit word");
static_assert(sizeof(diag_state) == 4, "the state is one plain 32-bit word");

// The UART selection: text starting with "CP" means the phone is in DIAG mode; anything else
// (such as "AP"), an empty file or no file at all does not.
constexpr char kUartSelectionFile[] = "/data/misc/radio/uart.txt";

// libdiag's peripheral number of the sensor processor, and the buffering watermarks in percent.
constexpr uint8_t kSensorPeripheral = 3;
constexpr uint8_t kLowWatermark = 1;
constexpr uint8_t kHighWatermark = 90;
constexpr uint8_t kTxModeStreaming = 2;
constexpr uint8_t kTxModeDump = 0;

// Reads a property into value (PROP_VALUE_MAX bytes, cleared first) and returns its length.
int read_property(const char* name, char (&value)[PROP_VALUE_MAX]) {
  memset(value, 0, sizeof value);
  return __system_property_get(name, value);
}

}  // namespace

diag_state diag_logging_state() {
  return diag_logging_state_value.load();
}

void set_diag_logging_state(diag_state state) {
  diag_logging_state_value.store(state);
}

int check_property() {
  char value[PROP_VALUE_MAX];
  if (read_property("persist.sys.usb.q_config", value) >= 1 && strstr(value, "diag") != nullptr) {
    KLOGI("%s is Diag Mode\n", "check_property");
    return -1;
  }
  KLOGI("%s Success\n", "check_property");
  return 1;
}

int check_files() {
  char path[PATH_MAX];
  platform_path(kUartSelectionFile, path, sizeof path);
  const int exists = access(path, F_OK);
  if (exists != 0) {
    KLOGI("%s is not exist %d\n", "check_files", exists);
    return 1;
  }
  const int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    KLOGE("%s open error %d", "check_files", errno);
    return -1;
  }
  // Two bytes at most, after which the buffer always holds a terminator.
  char text[3] = {0, 0, 0};
  if (read(fd, text, 2) < 0) {
    KLOGE("%s read fails", "check_files");
    close(fd);
    return -1;
  }
  if (strcmp(text, "CP") == 0) {
    KLOGI("%s is Diag Mode %s\n", "check_files", text);
    close(fd);
    return -1;
  }
  KLOGI("%s is AP Mode %s\n", "check_files", text);
  close(fd);
  return 1;
}

bool check_loglevel() {
  char value[PROP_VALUE_MAX];
  if (read_property("ro.debug_level", value) >= 1 && strstr(value, "0x4f4c") != nullptr) {
    KLOGI("%s stop logging\n", "check_loglevel");
    return true;
  }
  return false;
}

int sns_set_diag_mode(uint8_t mode) {
  if (!Diag_LSM_Init(nullptr)) {
    KLOGE("%s: Diag_LSM_Init failed\n", "sns_set_diag_mode");
    Diag_LSM_DeInit();
    return -1;
  }
  KLOGE("%s: diag_configure_peripheral_buffering_tx_mode Enter\n", "sns_set_diag_mode");
  const int result = diag_configure_peripheral_buffering_tx_mode(kSensorPeripheral, mode,
                                                                 kLowWatermark, kHighWatermark);
  if (result == 1) {
    platform_sleep_seconds(1);
  } else {
    KLOGE("%s: Failed configuring the peripheral tx_mode, result: %d\n", "sns_set_diag_mode",
          result);
  }
  Diag_LSM_DeInit();
  return result;
}

void sns_set_diag_tx_mode() {
  int allowed = check_property();
  if (allowed == 1) allowed = check_files();
  if (allowed < 0) {
    set_diag_logging_state(diag_state::stopped);
    KLOGI("%s: DM mode is setting\n", "sns_set_diag_tx_mode");
    return;
  }
  const int r = sns_set_diag_mode(kTxModeStreaming);
  if (r != 1) {
    KLOGE("%s: sns_set_diag_mode result: %d\n", "sns_set_diag_tx_mode", r);
    return;
  }
  KLOGI("%s: diag_mdlog Enter %d\n", "sns_set_diag_tx_mode", 1);
  run_shell_command(kDiagMdlogStart);
  // Logging counts as enabled, so that a dump may stop it, only 5 s after the tool started.
  platform_sleep_seconds(5);
  set_diag_logging_state(diag_state::logging);
}

void* diag_logging_start_thread(void*) {
  KLOGI("%s start\n", "diag_logging_start_thread");
  platform_sleep_seconds(3);
  if (check_loglevel()) {
    set_diag_logging_state(diag_state::stopped);
    return nullptr;
  }
  // The first open of the sensor service happens here, in practice; the handle is not needed.
  get_handle_for_sensor(0);
  sns_set_diag_tx_mode();
  return nullptr;
}

void* diag_logging_thread(void*) {
  // Every dump starts one of these and nobody joins it.
  pthread_detach(pthread_self());
  KLOGI("%s start\n", "diag_logging_thread");
  const int r = sns_set_diag_mode(kTxModeDump);
  if (r != 1) KLOGE("%s: sns_set_diag_mode result: %d\n", "send_dumpstate", r);
  run_shell_command(kDiagMdlogStop);
  platform_sleep_seconds(2);
  // A stop (command 27 with argument 1, or a broken link) during the pause ends the dump here.
  if (diag_logging_state() == diag_state::stopped) return nullptr;
  sns_set_diag_tx_mode();
  return nullptr;
}
