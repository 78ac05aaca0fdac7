// Placeholder until DIAG logging control lands.
#include "diag_logging.h"

#include <atomic>

namespace {
std::atomic<int32_t> g_state{0};
}

const char kDiagMdlogStart[] = "diag_mdlog -f /system/etc/Diag_Sensor.cfg -p 16 -o /data/log -n 3 -s 1 -c&";
const char kDiagMdlogStop[] = "diag_mdlog -k -p 16";

int32_t diag_logging_state() { return g_state.load(); }
void set_diag_logging_state(int32_t state) { g_state.store(state); }
int check_property() { return 1; }
int check_files() { return 1; }
bool check_loglevel() { return false; }
int sns_set_diag_mode(uint8_t) { return 1; }
void sns_set_diag_tx_mode() {}
void* diag_logging_start_thread(void*) { return nullptr; }
void* diag_logging_thread(void*) { return nullptr; }
