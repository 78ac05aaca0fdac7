// SPDX-License-Identifier: Apache-2.0
// A tool's command line and its main.
#include "tools/soak/tool_main.h"

#include <signal.h>
#include <stdio.h>
#include <stdlib.h>

namespace kestrel_driver {

namespace {

void print_usage(FILE* out, const char* usage_line, const std::vector<ToolOption>& options) {
  fprintf(out, "%s\n", usage_line);
  for (const ToolOption& o : options) {
    const std::string flag =
        std::string(o.flag) + (o.value != nullptr ? " " : "") + (o.value != nullptr ? o.value : "");
    fprintf(out, "  %-19s %s\n", flag.c_str(), o.help);
  }
}

}  // namespace

bool parse_tool_options(int argc, char** argv, const char* usage_line,
                        const std::vector<ToolOption>& options) {
  for (int i = 1; i < argc; ++i) {
    const std::string a = argv[i];
    if (a == "--help") {
      print_usage(stdout, usage_line, options);
      exit(0);
    }
    const ToolOption* found = nullptr;
    for (const ToolOption& o : options) found = a == o.flag ? &o : found;
    if (found == nullptr || (found->value != nullptr && i + 1 >= argc)) {
      print_usage(stderr, usage_line, options);
      return false;
    }
    found->set(found->value != nullptr ? argv[++i] : nullptr);
  }
  return true;
}

void prepare_tool_process() {
  signal(SIGPIPE, SIG_IGN);
  setvbuf(stdout, nullptr, _IOLBF, 0);
}

}  // namespace kestrel_driver
