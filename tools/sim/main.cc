// SPDX-License-Identifier: Apache-2.0
// kestrel-sim: the sensor processor of the host build. Serves the sensor1 socket as a healthy
// phone and prints one line per request it answers, so a demo or a tester can watch the daemon
// talk to the sensors.
#include <errno.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <atomic>
#include <chrono>
#include <mutex>
#include <optional>
#include <string>

#include "tools/sim/healthy_phone.h"
#include "tools/sim/simulator.h"

namespace {

constexpr char kDefaultSocket[] = "/tmp/kestrel-sensor1.sock";

void usage(FILE* out) {
  fprintf(out,
          "usage: kestrel-sim [options]\n"
          "Plays the phone's sensor processor for kestreld on the host: serves the sensor1\n"
          "socket and answers every request like a healthy phone.\n"
          "\n"
          "  --socket PATH          socket to serve (default: $KESTREL_SENSOR1_SOCKET, else %s)\n"
          "  --quiet                print nothing per request\n"
          "  --drop-after SECONDS   drop the first connection SECONDS after it opened, once;\n"
          "                         the daemon sees a broken pipe and connects again\n"
          "  --refuse-opens N       answer the first N opens with 11 (service not ready)\n"
          "  --help                 this text\n"
          "\n"
          "Stops on SIGINT or SIGTERM.\n",
          kDefaultSocket);
}

bool parse_count(const char* text, long max, long* out) {
  char* end = nullptr;
  errno = 0;
  const long v = strtol(text, &end, 10);
  if (errno != 0 || end == text || *end != '\0' || v < 0 || v > max) return false;
  *out = v;
  return true;
}

std::mutex g_print_mu;

void print_line(const std::string& line) {
  std::lock_guard<std::mutex> lock(g_print_mu);
  fprintf(stdout, "%s\n", line.c_str());
  fflush(stdout);
}

struct Options {
  std::string socket_path;
  bool quiet = false;
  long drop_after = -1;  // seconds; -1: never
  long refuse = 0;
};

// Parses the command line into options; an exit status when the program is to stop at once.
std::optional<int> parse_options(int argc, char** argv, Options* opt) {
  const char* env_socket = getenv("KESTREL_SENSOR1_SOCKET");
  opt->socket_path = env_socket != nullptr && env_socket[0] != '\0' ? env_socket : kDefaultSocket;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const bool has_value = i + 1 < argc;
    if (arg == "--help" || arg == "-h") {
      usage(stdout);
      return 0;
    } else if (arg == "--quiet" || arg == "-q") {
      opt->quiet = true;
    } else if (arg == "--socket" && has_value) {
      opt->socket_path = argv[++i];
    } else if (arg == "--drop-after" && has_value &&
               parse_count(argv[i + 1], 86400, &opt->drop_after)) {
      ++i;
    } else if (arg == "--refuse-opens" && has_value &&
               parse_count(argv[i + 1], 1000000, &opt->refuse)) {
      ++i;
    } else {
      fprintf(stderr, "kestrel-sim: bad argument '%s'\n", arg.c_str());
      usage(stderr);
      return 2;
    }
  }
  return std::nullopt;
}

// When the first connection opened, for --drop-after. It outlives the simulator, whose hooks
// write it.
struct FirstOpen {
  std::atomic<bool> seen{false};
  std::chrono::steady_clock::time_point at;
};

// The trace lines of the program, and the time of the first open.
void watch(kestrel_sim::Simulator& sim, const Options& opt, FirstOpen* first) {
  const bool quiet = opt.quiet;
  sim.set_connection_hook([=](kestrel_sim::Simulator&, int connection, bool opened) {
    if (!quiet) {
      print_line("connection " + std::to_string(connection) + (opened ? " opened" : " ended"));
    }
    if (opened && !first->seen.load()) {
      first->at = std::chrono::steady_clock::now();
      first->seen.store(true);
    }
  });
  if (quiet) return;
  sim.set_request_hook([](kestrel_sim::Simulator&, const kestrel_sim::Request& r) {
    print_line("request " + kestrel_sim::describe_request(r));
  });
  print_line("kestrel-sim: serving " + opt.socket_path + " as a healthy phone");
}

// Serves until SIGINT or SIGTERM, dropping the first connection once when --drop-after says so.
void serve(kestrel_sim::Simulator& sim, const Options& opt, const sigset_t& stop_signals,
           FirstOpen* first) {
  watch(sim, opt, first);
  bool dropped = false;
  for (;;) {
    const timespec tick = {0, 100 * 1000 * 1000};
    const int sig = sigtimedwait(&stop_signals, nullptr, &tick);
    if (sig == SIGINT || sig == SIGTERM) break;
    if (opt.drop_after < 0 || dropped || !first->seen.load()) continue;
    if (std::chrono::steady_clock::now() - first->at >= std::chrono::seconds(opt.drop_after)) {
      dropped = true;
      if (!opt.quiet) {
        print_line("dropping connection " + std::to_string(sim.current_connection()));
      }
      sim.drop_connection();
    }
  }
}

}  // namespace

int main(int argc, char** argv) {
  Options opt;
  if (const std::optional<int> status = parse_options(argc, argv, &opt)) return *status;

  // The signals are taken synchronously below; every thread the simulator starts inherits the
  // mask, so none of them is interrupted.
  sigset_t stop_signals;
  sigemptyset(&stop_signals);
  sigaddset(&stop_signals, SIGINT);
  sigaddset(&stop_signals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &stop_signals, nullptr);
  signal(SIGPIPE, SIG_IGN);

  FirstOpen first;
  kestrel_sim::Simulator sim(opt.socket_path, true);
  if (!sim.listening()) return 1;
  if (opt.refuse > 0) sim.refuse_opens(11, static_cast<int>(opt.refuse));
  serve(sim, opt, stop_signals, &first);
  if (!opt.quiet) print_line("kestrel-sim: stopped");
  return 0;
}
