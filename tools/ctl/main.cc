// SPDX-License-Identifier: Apache-2.0
// kestrelctl: plays the kernel factory driver for kestreld on a workstation. It sends command
// frames to the daemon's netlink port and prints, decoded, the frames the daemon sends back to
// the kernel's port. Its commands and options are the tables of commands.cc.
#include <stdio.h>

#include "command_table.h"

int main(int argc, char** argv) {
  try {
    kestrelctl::Session session(kestrelctl::parse_options(argc, argv));
    return kestrelctl::run_command_line(session);
  } catch (const kestrelctl::UsageError& e) {
    fprintf(stderr, "kestrelctl: %s\nRun 'kestrelctl --help' for the commands.\n", e.what());
    return kestrelctl::kExitUsage;
  }
}
