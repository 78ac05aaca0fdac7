// SPDX-License-Identifier: Apache-2.0
// One run of kestrelctl: its options, the kernel port it plays the kernel through, the capture it
// keeps, and the ways of sending, waiting and printing that its commands share.
#pragma once

#include <stdint.h>

#include <chrono>
#include <functional>
#include <optional>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "capture.h"
#include "frame_codec.h"
#include "kernel_port.h"

namespace kestrelctl {

class StreamSamples;

constexpr int kExitOk = 0;
constexpr int kExitNoReply = 1;
constexpr int kExitUsage = 2;
constexpr int kExitChannel = 3;
constexpr int kExitFile = 4;

constexpr double kReplyTimeoutSeconds = 12.0;  // the daemon's 8 s wait, and some slack

// A command line kestrelctl cannot run: the message, then exit status 2.
struct UsageError : std::runtime_error {
  using std::runtime_error::runtime_error;
};

struct Options {
  bool json = false;
  bool quiet = false;
  bool help = false;
  std::optional<double> timeout;
  std::optional<double> seconds;
  std::optional<long> count;
  std::optional<int32_t> flag;
  std::optional<std::string> pcap, csv, plot, live;
  std::vector<std::string> args;   // the command's words and its arguments
  std::vector<std::string> given;  // the names of the options given, in order
};

// Ctrl-C (SIGINT) and SIGTERM end a listen, a live decode or a stream's sampling instead of the
// process: they set a flag and end the wait they come in.
void catch_interrupts();
bool interrupted();
void clear_interrupt();

using Clock = std::chrono::steady_clock;
// A deadline some seconds ahead, and what is left of it as a poll timeout.
Clock::time_point after_seconds(double seconds);
int milliseconds_until(Clock::time_point deadline);

// The arguments of commands, or a UsageError that says what is wrong with them.
int32_t sensor_argument(const std::string& text);
int32_t number_argument(const std::string& what, const std::string& text);

class Session {
 public:
  using Match = std::function<bool(const Frame&)>;

  explicit Session(Options options) : o_(std::move(options)) {}

  const Options& options() const { return o_; }
  // The words after the command's name.
  const std::vector<std::string>& arguments() const { return arguments_; }
  void set_command(size_t name_words, const std::string& usage);
  // A UsageError with the usage line of the command.
  [[noreturn]] void usage_error() const;

  // Every datagram sent and received also goes to the capture at path.
  bool keep_capture(const std::string& path, std::string* error);
  const CaptureWriter& capture() const { return capture_; }
  KernelPort& port() { return port_; }

  void out(const std::string& text);
  void note(const std::string& message);
  int channel_error(const std::string& message);
  void print_frame(const Frame& frame, bool unrelated);
  void print_sent(const std::vector<uint8_t>& datagram, bool raw = false);

  // The timeout of a reply: --timeout, or the nominal one times KESTREL_TIME_SCALE, at least 1 s.
  double reply_timeout(double nominal = kReplyTimeoutSeconds) const;
  // From a port of its own, so that the kernel's port stays free for a listener elsewhere.
  int send_only(const std::vector<uint8_t>& datagram, bool raw = false);
  // From the kernel's port; waits for a frame of one of the types (and is_reply, if given).
  int send_and_wait(const std::vector<uint8_t>& datagram, const std::set<uint16_t>& reply_types,
                    double timeout, const Match& is_reply = nullptr);
  // Prints frames until the reply has come (exit 0) or the time is up (exit 1). Frames that are
  // neither the reply nor related to the command are marked, or skipped with --quiet.
  int await(const Match& is_reply, const Match& is_related, double timeout,
            const std::string& what);
  // The samples to --csv and --plot, when asked for.
  int write_samples(const StreamSamples& samples);

 private:
  Options o_;
  std::vector<std::string> arguments_;
  std::string usage_;
  CaptureWriter capture_;
  KernelPort port_;
};

}  // namespace kestrelctl
