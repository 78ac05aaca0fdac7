// SPDX-License-Identifier: Apache-2.0
// System properties from the KESTREL_PROPERTIES file: "name=value" a line, '#' comments. The
// file is read on every call, so a test may change it while the daemon runs.
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/system_properties.h>

#include "host_env.h"

extern "C" int __system_property_get(const char* name, char* value) {
  value[0] = '\0';
  const char* path = host_environment().properties;
  if (path == nullptr || name == nullptr) return 0;
  FILE* f = fopen(path, "re");
  if (f == nullptr) return 0;
  const size_t name_len = strlen(name);
  char* line = nullptr;
  size_t capacity = 0;
  int length = 0;
  while (getline(&line, &capacity, f) >= 0) {
    size_t n = strcspn(line, "\r\n");
    line[n] = '\0';
    if (line[0] == '#') continue;
    if (strncmp(line, name, name_len) != 0 || line[name_len] != '=') continue;
    const char* v = line + name_len + 1;
    size_t vlen = strlen(v);
    if (vlen > PROP_VALUE_MAX - 1) vlen = PROP_VALUE_MAX - 1;
    memcpy(value, v, vlen);
    value[vlen] = '\0';
    length = static_cast<int>(vlen);
    break;
  }
  free(line);
  fclose(f);
  return length;
}
