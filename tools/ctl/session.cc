// SPDX-License-Identifier: Apache-2.0
#include "session.h"

#include <limits.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>

#include <algorithm>

#include "frame_decoder.h"
#include "kernel_frame.h"
#include "sensor_names.h"
#include "stream_plot.h"

namespace kestrelctl {
namespace {

volatile sig_atomic_t g_interrupted = 0;

void on_interrupt(int) {
  g_interrupted = 1;
}

double time_scale() {
  const char* v = getenv("KESTREL_TIME_SCALE");
  if (v == nullptr || v[0] == '\0') return 1.0;
  char* end = nullptr;
  const double d = strtod(v, &end);
  return (end != v && *end == '\0' && d >= 0.0) ? d : 1.0;
}

}  // namespace

void catch_interrupts() {
  struct sigaction sa = {};
  sa.sa_handler = on_interrupt;
  sigemptyset(&sa.sa_mask);
  sa.sa_flags = 0;  // no SA_RESTART: the wait for frames returns at once
  sigaction(SIGINT, &sa, nullptr);
  sigaction(SIGTERM, &sa, nullptr);
}

bool interrupted() {
  return g_interrupted != 0;
}

void clear_interrupt() {
  g_interrupted = 0;
}

// At most about four months ahead, which no wait needs.
Clock::time_point after_seconds(double seconds) {
  return Clock::now() + std::chrono::duration_cast<Clock::duration>(
                            std::chrono::duration<double>(std::min(seconds, 1e7)));
}

int milliseconds_until(Clock::time_point deadline) {
  const int64_t left =
      std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
  return static_cast<int>(std::min<int64_t>(std::max<int64_t>(left, 0), INT_MAX));
}

int32_t sensor_argument(const std::string& text) {
  int32_t sensor_type = 0;
  if (!parse_sensor(text, &sensor_type)) {
    throw UsageError("'" + text +
                     "' is no sensor: use accel, gyro, mag, pressure, light, light-short or a "
                     "sensor_type number");
  }
  return sensor_type;
}

int32_t number_argument(const std::string& what, const std::string& text) {
  int32_t v = 0;
  if (!parse_int32(text, &v)) {
    throw UsageError(what + " '" + text + "' is not a signed 32-bit number");
  }
  return v;
}

void Session::set_command(size_t name_words, const std::string& usage) {
  arguments_.assign(o_.args.begin() + std::min(name_words, o_.args.size()), o_.args.end());
  usage_ = usage;
}

void Session::usage_error() const {
  throw UsageError("usage: kestrelctl " + usage_);
}

bool Session::keep_capture(const std::string& path, std::string* error) {
  if (!capture_.open(path, error)) return false;
  port_.tap(&capture_);
  return true;
}

void Session::out(const std::string& text) {
  fputs(text.c_str(), stdout);
  fflush(stdout);
}

void Session::note(const std::string& message) {
  fprintf(stderr, "kestrelctl: %s\n", message.c_str());
}

int Session::channel_error(const std::string& message) {
  note(message);
  return kExitChannel;
}

void Session::print_frame(const Frame& frame, bool unrelated) {
  const DecodedFrame d = decode_frame(frame);
  out(o_.json ? format_json(d, unrelated) + "\n" : format_text(d, unrelated));
}

void Session::print_sent(const std::vector<uint8_t>& datagram, bool raw) {
  if (raw || datagram.size() < kFrameHeaderSize) {
    out(o_.json ? "{\"sent\":{\"size\":" + std::to_string(datagram.size()) +
                      ",\"bytes\":" + json_string(to_hex(datagram)) + "}}\n"
                : "sent " + std::to_string(datagram.size()) + " bytes: " + to_hex(datagram, " ") +
                      "\n");
    return;
  }
  const DecodedFrame d = decode_command(split_frames(datagram.data(), datagram.size()).at(0));
  out(o_.json ? "{\"sent\":" + format_json(d) + "}\n" : "sent " + format_text(d));
}

double Session::reply_timeout(double nominal) const {
  if (o_.timeout) return *o_.timeout;
  return std::max(1.0, nominal * time_scale());
}

int Session::send_only(const std::vector<uint8_t>& datagram, bool raw) {
  std::string error;
  if (!port_.open_unbound(&error) || !port_.send(datagram, &error)) return channel_error(error);
  print_sent(datagram, raw);
  return kExitOk;
}

int Session::send_and_wait(const std::vector<uint8_t>& datagram, const std::set<uint16_t>& types,
                           double timeout, const Match& is_reply) {
  std::string error;
  if (!port_.open_bound(kernel_port_from_environment(), &error) || !port_.send(datagram, &error)) {
    return channel_error(error);
  }
  print_sent(datagram);
  std::string what;
  for (const uint16_t t : types)
    what += (what.empty() ? "frame type " : " or ") + std::to_string(t);
  return await(
      [&](const Frame& f) {
        return !f.malformed && types.count(f.type) != 0 && (!is_reply || is_reply(f));
      },
      nullptr, timeout, what);
}

int Session::await(const Match& is_reply, const Match& is_related, double timeout,
                   const std::string& what) {
  const Clock::time_point deadline = after_seconds(timeout);
  for (;;) {
    std::vector<Frame> frames;
    std::string error;
    switch (port_.receive(milliseconds_until(deadline), &frames, &error)) {
      case KernelPort::Wait::kTimeout: {
        char seconds[32];
        snprintf(seconds, sizeof seconds, "%g", timeout);
        note("no reply (" + what + ") from kestreld within " + seconds + " s");
        return kExitNoReply;
      }
      case KernelPort::Wait::kInterrupted:
        note("interrupted while waiting for the reply (" + what + ")");
        return kExitNoReply;
      case KernelPort::Wait::kOverrun:
        note("frames were lost: the receive queue overflowed");
        continue;
      case KernelPort::Wait::kError:
        return channel_error(error);
      case KernelPort::Wait::kFrames:
        break;
    }
    bool replied = false;
    for (const Frame& f : frames) {
      const bool reply = !replied && is_reply(f);
      const bool related = reply || (is_related && is_related(f));
      if (related || !o_.quiet) print_frame(f, !related);
      replied = replied || reply;
    }
    if (replied) return kExitOk;
  }
}

int Session::write_samples(const StreamSamples& samples) {
  std::string error;
  if (samples.others() > 0) {
    note(std::to_string(samples.others()) +
         " samples of other sensors are left out of the CSV and the plot");
  }
  if (o_.csv && !samples.write_csv(*o_.csv, &error)) {
    note(error);
    return kExitFile;
  }
  if (o_.plot && !samples.write_plot(*o_.plot, &error)) {
    note(error);
    return kExitFile;
  }
  return kExitOk;
}

}  // namespace kestrelctl
