// SPDX-License-Identifier: Apache-2.0
// kestrelctl's command line by its tables: the options, the command and its arguments, the help.
#include <algorithm>

#include "command_table.h"

namespace kestrelctl {
namespace {

const char kIntro[] =
    R"(kestrelctl plays the kernel factory driver for kestreld: it sends command frames to the
daemon (netlink port 20000) and prints, decoded, the frames the daemon sends to the kernel's
port (KESTREL_KERNEL_PORT, default 100).

)";

const char* const kSectionHeads[] = {
    "Commands that wait for their reply (exit status 1 when it does not come in time):\n",
    ("\nCommands that only send (they leave the kernel's port free, so that a `kestrelctl listen`\n"
     "in another terminal shows what the daemon answers):\n"),
    "\n",
    "\nCaptures:\n",
};

const char kSensors[] =
    R"(
Sensors: accel 0, gyro 1, mag 2, pressure 3, light 4, light-short 5, or any sensor_type
number (negative allowed; 0x hex too).
)";

const char kNotes[] =
    R"(
Self-test verdicts: PASS/FAIL is read from word 1 of the reply (frames 9 and 14), the
sensor's own result word, which the daemon relays unchanged: 1 is PASS, anything else FAIL
(for the magnetometer the daemon writes -1 there when the sensor reports a failed test). A
reply sent after the daemon's own 8 s wait ran out holds the previous result.

Samples: accelerometer values are also shown in g (4096 counts a g), gyroscope values in
degrees per second (70 counts a degree per second) and magnetometer values in microtesla
(0.15 uT a count), as the daemon scales them; other sensors' values stay counts.

Exit status: 0 done (reply received), 1 no reply in time, 2 usage error, 3 the netlink
channel failed (port taken, no daemon), 4 a capture, CSV or plot file could not be read or
written.
)";

std::vector<std::string> words_of(const std::string& text) {
  std::vector<std::string> words;
  size_t start = 0;
  while ((start = text.find_first_not_of(' ', start)) != std::string::npos) {
    const size_t end = std::min(text.find(' ', start), text.size());
    words.push_back(text.substr(start, end - start));
    start = end;
  }
  return words;
}

// A label and its help lines, the lines from column indent, the first beside the label when it
// leaves room.
std::string entry(const std::string& label, const char* help, size_t indent) {
  std::string out = "  " + label;
  out +=
      out.size() < indent ? std::string(indent - out.size(), ' ') : "\n" + std::string(indent, ' ');
  for (const char* p = help; *p != '\0'; ++p) {
    out += *p;
    if (*p == '\n' && p[1] != '\0') out += std::string(indent, ' ');
  }
  return out;
}

const OptionSpec* option_named(const std::string& name) {
  for (const OptionSpec& spec : option_table()) {
    if (name == spec.name || (name == "-h" && std::string(spec.name) == "--help")) return &spec;
  }
  return nullptr;
}

// The option's value, from "--name=value" or from the next word.
std::string value_of(const std::string& name, const std::string* inline_value, int argc,
                     char** argv, int* i) {
  if (inline_value != nullptr) return *inline_value;
  if (*i + 1 >= argc) throw UsageError(name + " needs a value");
  return argv[++*i];
}

// The commands of the options' first word, and the one of them the command line names: the one
// whose second word follows, or whose option is given, else the one without a second word.
const Command& find_command(const Options& o) {
  std::vector<const Command*> named;
  const Command* plain = nullptr;
  for (const Command& c : command_table()) {
    const std::vector<std::string> name = words_of(c.name);
    if (name[0] != o.args[0]) continue;
    named.push_back(&c);
    if (name.size() == 1) {
      plain = &c;
    } else if (name[1][0] == '-' ? std::count(o.given.begin(), o.given.end(), name[1]) > 0
                                 : o.args.size() > 1 && o.args[1] == name[1]) {
      return c;
    }
  }
  if (plain != nullptr) return *plain;
  if (named.empty()) throw UsageError("unknown command '" + o.args[0] + "'");
  std::string usage;
  for (const Command* c : named) usage += (usage.empty() ? "" : " | ") + c->usage();
  throw UsageError("usage: kestrelctl " + usage);
}

// Every option given applies to the command, or the UsageError names those it applies to.
void check_options(const Options& o, const Command& command) {
  for (const std::string& name : o.given) {
    const OptionSpec* spec = option_named(name);
    auto applies = [&](const Command& c) {
      return spec->scope == Scope::kEverywhere || c.takes(name) ||
             (spec->scope == Scope::kChannel && c.section != Section::kCapture);
    };
    if (applies(command)) continue;
    std::vector<std::string> names;
    for (const Command& c : command_table()) {
      if (applies(c)) names.push_back(c.name);
    }
    if (names.size() > 3) throw UsageError(name + " does not apply to " + command.name);
    std::string list = names[0];
    for (size_t i = 1; i < names.size(); ++i) {
      list += (i + 1 == names.size() ? " and " : ", ") + names[i];
    }
    throw UsageError(name + " applies to " + list + " only");
  }
}

// As many arguments as the usage line has: each "<x>" one, "[x]" one more at most, "..." any.
bool argument_count_fits(const Command& command, size_t count) {
  size_t required = 0;
  size_t optional = 0;
  for (const std::string& w : words_of(command.arguments)) {
    if (w.find("...") != std::string::npos) return count >= required;
    if (w[0] == '<') ++required;
    if (w[0] == '[' && w[1] != '-') ++optional;
  }
  return count >= required && count <= required + optional;
}

}  // namespace

std::string Command::usage() const {
  return arguments[0] == '\0' ? name : std::string(name) + " " + arguments;
}

bool Command::takes(const std::string& option) const {
  for (const std::string& w : words_of(usage())) {
    if (w == option || w == "[" + option) return true;
  }
  return false;
}

Options parse_options(int argc, char** argv) {
  Options o;
  bool positional_only = false;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (positional_only || arg.size() < 2 || arg[0] != '-' || (arg[1] != '-' && arg != "-h")) {
      o.args.push_back(arg);  // negative numbers are arguments too
      continue;
    }
    if (arg == "--") {
      positional_only = true;
      continue;
    }
    const size_t eq = arg.find('=');
    const std::string name = arg.substr(0, eq);
    const std::string inline_value = eq == std::string::npos ? "" : arg.substr(eq + 1);
    const OptionSpec* spec = option_named(name);
    if (spec == nullptr || (spec->value == nullptr && eq != std::string::npos)) {
      throw UsageError("unknown option " + arg);
    }
    const std::string value =
        spec->value == nullptr
            ? ""
            : value_of(name, eq == std::string::npos ? nullptr : &inline_value, argc, argv, &i);
    spec->set(&o, value);
    o.given.push_back(spec->name);
  }
  return o;
}

std::string help_text() {
  std::string out = kIntro;
  std::string usage = "Usage: kestrelctl";
  for (const OptionSpec& spec : option_table()) {
    if (spec.scope == Scope::kOwn || std::string(spec.name) == "--help") continue;
    usage +=
        std::string(" [") + spec.name + (spec.value ? std::string(" ") + spec.value : "") + "]";
  }
  out += usage + "\n                  <command> [arguments]\n\n";
  for (int section = 0; section < 4; ++section) {
    out += kSectionHeads[section];
    for (const Command& c : command_table()) {
      if (static_cast<int>(c.section) == section) out += entry(c.usage(), c.help, 34);
    }
  }
  out += kSensors;
  out += "\nOptions:\n";
  for (const OptionSpec& spec : option_table()) {
    out += entry(std::string(spec.name) + (spec.value ? std::string(" ") + spec.value : ""),
                 spec.help, 17);
  }
  return out + kNotes;
}

int run_command_line(Session& session) {
  const Options& o = session.options();
  if (o.help || (!o.args.empty() && o.args[0] == "help")) {
    session.out(help_text());
    return kExitOk;
  }
  if (o.args.empty()) throw UsageError("no command");
  const Command& command = find_command(o);
  check_options(o, command);
  const std::vector<std::string> name = words_of(command.name);
  session.set_command(name.size() > 1 && name[1][0] != '-' ? 2 : 1, command.usage());
  if (!argument_count_fits(command, session.arguments().size())) session.usage_error();
  std::string error;
  if (o.pcap && command.section != Section::kCapture && !session.keep_capture(*o.pcap, &error)) {
    session.note(error);
    return kExitFile;
  }
  const int status = command.run(session, command);
  if (!session.capture().error().empty()) {
    session.note(session.capture().error());
    return status != kExitOk ? status : kExitFile;
  }
  return status;
}

}  // namespace kestrelctl
