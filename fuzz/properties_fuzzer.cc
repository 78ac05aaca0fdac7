// SPDX-License-Identifier: Apache-2.0
// The properties file of the host build, as __system_property_get reads it for the two names the
// daemon asks for, and the daemon's USB-configuration check over it. The input is the whole file.
// (The file is read anew at every call; each read is a handful of system calls, so the target
// reads it three times per input and no more.)
//
// Checks besides the sanitizers: the value always fits PROP_VALUE_MAX with its terminator and the
// result is the value's length.
#include <stddef.h>
#include <stdint.h>
#include <string.h>
#include <sys/system_properties.h>

#include <memory>

#include "diag/diag_logging.h"
#include "fuzz_support.h"

namespace {

const kestrel_fuzz::fuzz_paths* g_paths = nullptr;

// The two names the daemon reads.
const char* const kNames[] = {"persist.sys.usb.q_config", "ro.debug_level"};

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  g_paths = &kestrel_fuzz::setup_fuzz_environment("", kestrel_fuzz::kCalibratedRegistry);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  kestrel_fuzz::write_file(g_paths->properties, data, size);
  // Exactly the room the interface promises, so one byte more is an overflow.
  std::unique_ptr<char[]> value(new char[PROP_VALUE_MAX]);
  for (const char* name : kNames) {
    memset(value.get(), 0x5a, PROP_VALUE_MAX);
    const int n = __system_property_get(name, value.get());
    const size_t length = strnlen(value.get(), PROP_VALUE_MAX);
    if (length == PROP_VALUE_MAX) kestrel_fuzz::fail("value of %s not terminated", name);
    if (n < 0 || static_cast<size_t>(n) != length) {
      kestrel_fuzz::fail("%s: result %d for a value of %zu bytes", name, n, length);
    }
  }
  const int property = check_property();
  if (property != 1 && property != -1) kestrel_fuzz::fail("check_property returned %d", property);
  return 0;
}
