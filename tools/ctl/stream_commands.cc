// SPDX-License-Identifier: Apache-2.0
// The commands that take frames as they come: a stream of samples, and a listen.
#include <stdio.h>

#include "handlers.h"
#include "kernel_frame.h"
#include "stream_plot.h"

namespace kestrelctl {
namespace {

constexpr double kStreamSeconds = 5.0;

bool is_sample(const Frame& f) {
  return !f.malformed && f.type == FRAME_SAMPLE;
}

void add_sample(StreamSamples* samples, const Frame& f, const struct timeval& t) {
  samples->add(f, t.tv_sec + t.tv_usec / 1e6);
}

}  // namespace

int stream(Session& session, const Command&) {
  const int32_t sensor_type = sensor_argument(session.arguments()[0]);
  const double seconds = session.options().seconds.value_or(kStreamSeconds);
  KernelPort& port = session.port();
  std::string error;
  if (!port.open_bound(kernel_port_from_environment(), &error)) {
    return session.channel_error(error);
  }
  catch_interrupts();
  const std::vector<uint8_t> start = build_command(NETLINK_MESSAGE_GET_RAW_DATA, {sensor_type});
  if (!port.send(start, &error)) return session.channel_error(error);
  session.print_sent(start);

  StreamSamples samples;
  const Clock::time_point end = after_seconds(seconds);
  while (!interrupted() && Clock::now() < end) {
    std::vector<Frame> frames;
    const KernelPort::Wait w = port.receive(milliseconds_until(end), &frames, &error);
    if (w == KernelPort::Wait::kError) return session.channel_error(error);
    if (w == KernelPort::Wait::kOverrun) {
      session.note("samples were lost: the receive queue overflowed");
    }
    for (const Frame& f : frames) {
      if (is_sample(f) || !session.options().quiet) session.print_frame(f, !is_sample(f));
      if (is_sample(f)) add_sample(&samples, f, port.received_at());
    }
  }
  clear_interrupt();

  const std::vector<uint8_t> stop = build_command(NETLINK_MESSAGE_STOP_RAW_DATA, {sensor_type});
  if (!port.send(stop, &error)) return session.channel_error(error);
  session.print_sent(stop);
  // Samples still on their way belong to the stream, in its CSV and plot too (await asks once
  // a frame whether it is related).
  auto late_sample = [&](const Frame& f) {
    if (is_sample(f)) add_sample(&samples, f, port.received_at());
    return is_sample(f);
  };
  const int r =
      session.await([](const Frame& f) { return !f.malformed && f.type == FRAME_STOP_RAW_DATA; },
                    late_sample, session.reply_timeout(), "frame type 3");
  const int written = session.write_samples(samples);
  return r != kExitOk ? r : written;
}

int listen(Session& session, const Command&) {
  const Options& o = session.options();
  KernelPort& port = session.port();
  std::string error;
  if (!port.open_bound(kernel_port_from_environment(), &error)) {
    return session.channel_error(error);
  }
  catch_interrupts();
  std::optional<Clock::time_point> end;
  if (o.seconds) end = after_seconds(*o.seconds);
  long received = 0;
  while (!interrupted() && (!end || Clock::now() < *end)) {
    std::vector<Frame> frames;
    const KernelPort::Wait w = port.receive(end ? milliseconds_until(*end) : -1, &frames, &error);
    if (w == KernelPort::Wait::kError) return session.channel_error(error);
    if (w == KernelPort::Wait::kOverrun)
      session.note("frames were lost: the receive queue overflowed");
    for (const Frame& f : frames) {
      session.print_frame(f, false);
      if (o.count && ++received >= *o.count) return kExitOk;
    }
  }
  if (o.count && o.seconds && !interrupted()) {
    char seconds[32];
    snprintf(seconds, sizeof seconds, "%g", *o.seconds);
    session.note(std::to_string(received) + " of " + std::to_string(*o.count) + " frames within " +
                 seconds + " s");
    return kExitNoReply;
  }
  return kExitOk;
}

}  // namespace kestrelctl
