// SPDX-License-Identifier: Apache-2.0
// A tool's command line, as a table of options, and its main.
#pragma once

#include <functional>
#include <string>
#include <vector>

namespace kestrel_driver {

struct ToolOption {
  const char* flag;   // "--seed"
  const char* value;  // what follows it in the usage ("N", "FILE"), nullptr for a flag alone
  const char* help;
  std::function<void(const char*)> set;  // given the value (nullptr for a flag alone)
};

// Sets the options of argv by the table. --help prints the usage on stdout and exits; anything
// else the table does not hold prints it on stderr and returns false.
bool parse_tool_options(int argc, char** argv, const char* usage_line,
                        const std::vector<ToolOption>& options);

// What a tool's process does before its run: no signal for a write to a peer that went away (the
// write fails instead), and stdout written line by line.
void prepare_tool_process();

// A tool's main: its options parsed (exit status 2 when they are not), the process prepared, and
// the exit status of its run.
template <typename Tool, typename Options>
int tool_main(int argc, char** argv, bool (*parse)(int, char**, Options*)) {
  Options o;
  if (!parse(argc, argv, &o)) return 2;
  prepare_tool_process();
  return Tool(o).run();
}

}  // namespace kestrel_driver
