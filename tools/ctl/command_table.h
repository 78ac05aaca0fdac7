// SPDX-License-Identifier: Apache-2.0
// kestrelctl's commands, one table: the help, the dispatch and every usage error come from it.
#pragma once

#include <stdint.h>

#include <string>
#include <utility>
#include <vector>

#include "session.h"

namespace kestrelctl {

// Where a command shows in the help, by what it waits for.
enum class Section {
  kReply,    // sends a command and waits for its reply (exit 1 when none comes in time)
  kSend,     // sends and leaves the kernel's port free
  kListen,   // waits for whatever the daemon sends
  kCapture,  // reads a capture, from a file or live
};

struct Command;
using Handler = int (*)(Session& session, const Command& command);

struct Command {
  Command(const char* name, const char* arguments, Section section, const char* help, Handler run,
          uint16_t number = 0, std::vector<int32_t> words = {}, std::vector<uint16_t> replies = {})
      : name(name),
        arguments(arguments),
        section(section),
        help(help),
        run(run),
        number(number),
        words(std::move(words)),
        replies(std::move(replies)) {}

  // One word, or two: "status", "calib read", "decode --live" (a form of a command that an
  // option selects).
  const char* name;
  // As the usage line shows them: "<name>" an argument, "..." any number more, "[--option X]"
  // an option of this command's own, "[word]" an optional argument, and first, for a form an
  // option selects, that option's value ("IFACE").
  const char* arguments;
  Section section;
  const char* help;  // lines of the help text, each ending in a newline
  Handler run;
  // For the commands that only build one command frame: its number, the words before the
  // arguments, and the frame types of the reply (none: it only sends).
  uint16_t number;
  std::vector<int32_t> words;
  std::vector<uint16_t> replies;

  std::string usage() const;
  // Whether --option is one of this command's own.
  bool takes(const std::string& option) const;
};

const std::vector<Command>& command_table();

// Which commands an option applies to.
enum class Scope {
  kEverywhere,
  kChannel,  // the commands that talk to the daemon, and the captures that list it
  kOwn,      // the commands that list it among their arguments
};

struct OptionSpec {
  const char* name;   // "--timeout"
  const char* value;  // what its value is ("SEC"), nullptr when it takes none
  Scope scope;
  const char* help;  // lines, each ending in a newline
  void (*set)(Options* options, const std::string& value);
};

const std::vector<OptionSpec>& option_table();

// The options and words of a command line, by the option table. Throws a UsageError.
Options parse_options(int argc, char** argv);

// The help text, with the usage line of every command and every option of the tables.
std::string help_text();

// Finds the command of the options' words in the table, checks its arguments and options, and
// runs it. A command line that does not fit throws a UsageError.
int run_command_line(Session& session);

}  // namespace kestrelctl
