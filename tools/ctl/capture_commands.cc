// SPDX-License-Identifier: Apache-2.0
// The commands that read captures of the kernel channel: a file, or an interface live.
#include <signal.h>
#include <stdio.h>
#include <time.h>

#include "frame_decoder.h"
#include "handlers.h"
#include "stream_plot.h"

namespace kestrelctl {
namespace {

// Live, SIGINT and SIGTERM come only while the reader waits, so that none is missed between the
// check of the flag and the wait.
void mask_interrupts(int how) {
  sigset_t interrupts;
  sigemptyset(&interrupts);
  sigaddset(&interrupts, SIGINT);
  sigaddset(&interrupts, SIGTERM);
  sigprocmask(how, &interrupts, nullptr);
}

// The time stamp of a captured datagram, in text (UTC time of day) and in JSON (seconds).
std::string stamp(const struct timeval& time, bool json) {
  char buf[64];
  if (json) {
    snprintf(buf, sizeof buf, "%lld.%06ld", static_cast<long long>(time.tv_sec),
             static_cast<long>(time.tv_usec));
  } else {
    struct tm t;
    const time_t seconds = time.tv_sec;
    gmtime_r(&seconds, &t);
    snprintf(buf, sizeof buf, "%02d:%02d:%02d.%06ld", t.tm_hour, t.tm_min, t.tm_sec,
             static_cast<long>(time.tv_usec));
  }
  return buf;
}

// The frames of one packet of protocol 23, each with its time and direction; how many.
size_t print_packet(Session& session, const CapturedPacket& p, StreamSamples* samples) {
  const std::vector<Frame> frames = split_frames(p.datagram.data(), p.datagram.size());
  for (const Frame& f : frames) {
    const DecodedFrame d = decode_by_sender(f);
    if (session.options().json) {
      session.out("{\"time\":" + stamp(p.time, true) + ",\"direction\":\"" +
                  (d.command ? "to_daemon" : "from_daemon") + "\"," + format_json(d).substr(1) +
                  "\n");
    } else {
      session.out(stamp(p.time, false) + (d.command ? " kernel > daemon  " : " daemon > kernel  ") +
                  format_text(d));
    }
    if (!d.command) samples->add(f, p.time.tv_sec + p.time.tv_usec / 1e6);
  }
  return frames.size();
}

// Prints the protocol 23 frames of the packets until the file ends or, live, until --seconds
// have passed or an interrupt comes; counts the packets of other protocols.
int decode_packets(Session& session, CaptureReader* reader, bool live) {
  std::optional<Clock::time_point> end;
  if (live && session.options().seconds) end = after_seconds(*session.options().seconds);
  StreamSamples samples;
  uint64_t frames = 0;
  uint64_t foreign = 0;
  int status = kExitOk;
  while (!interrupted() && (!end || Clock::now() < *end)) {
    CapturedPacket p;
    std::string error;
    const CaptureReader::Next next = reader->next(&p, &error, end ? milliseconds_until(*end) : -1);
    if (next == CaptureReader::Next::kEnd && !live) break;
    if (next == CaptureReader::Next::kEnd) continue;
    if (next == CaptureReader::Next::kError) {
      session.note(error);
      status = kExitFile;
      break;
    }
    if (p.arphrd != kArphrdNetlink || p.protocol != kCaptureProtocol) {
      ++foreign;
      continue;
    }
    if (p.datagram.size() < p.original_size) {
      session.note("packet " + std::to_string(p.number) +
                   " is cut short: " + std::to_string(p.datagram.size()) + " of its " +
                   std::to_string(p.original_size) +
                   " bytes were captured (capture with tcpdump -s 0)");
      status = kExitFile;
      break;
    }
    frames += print_packet(session, p, &samples);
  }
  if (live) mask_interrupts(SIG_UNBLOCK);
  session.note(std::to_string(frames) + " frames of netlink protocol 23; " +
               std::to_string(foreign) + " packets of other protocols skipped");
  const int written = session.write_samples(samples);
  return status != kExitOk ? status : written;
}

}  // namespace

int decode_file(Session& session, const Command&) {
  const std::string& path = session.arguments()[0];
  CaptureReader reader;
  std::string error;
  if (!reader.open(path, &error)) {
    session.note(error);
    return kExitFile;
  }
  if (!reader.carries_netlink()) {
    session.note(path + ": link type " + reader.link_type_name() +
                 " carries no netlink (capture on an nlmon interface, or on any)");
  }
  return decode_packets(session, &reader, false);
}

int decode_live(Session& session, const Command&) {
  const std::string& interface = *session.options().live;
  const std::optional<std::string>& keep = session.options().pcap;
  CaptureReader reader;
  std::string error;
  if (!reader.open_live(interface, &error) || (keep && !reader.keep(*keep, &error))) {
    session.note(error);
    return kExitFile;
  }
  mask_interrupts(SIG_BLOCK);
  catch_interrupts();
  session.note(
      "listening on " + interface + ", link type " + reader.link_type_name() +
      (reader.carries_netlink() ? "" : " (no netlink: its packets are skipped and counted)"));
  return decode_packets(session, &reader, true);
}

}  // namespace kestrelctl
