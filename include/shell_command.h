// SPDX-License-Identifier: Apache-2.0
// Shell commands run through system(). Their exit status is never examined.
#pragma once

#include <stdlib.h>

inline void run_shell_command(const char* command) {
  int status = system(command);
  (void)status;
}
