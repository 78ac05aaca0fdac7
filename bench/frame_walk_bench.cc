// SPDX-License-Identifier: Apache-2.0
// The frame walk: a full 1024-byte datagram of 64 frames whose command numbers are above 36, so
// each costs the walk and its one "process_message: <command>" line and nothing else. Measured
// per frame with the log going to a no-op logger and to liblog's real stderr logger (stderr on
// /dev/null for the run), against the same walk written bare with the same one line per frame
// through the same logger: what the walk adds to the log line it must write.
#include <fcntl.h>
#include <linux/netlink.h>
#include <string.h>
#include <unistd.h>

#include <cmath>

#include "bench/bench_support.h"
#include "kernel_channel/process_message.h"
#include "kestrel_log.h"

namespace {

constexpr int kFrames = 64;
constexpr size_t kFrameSize = 16;
static_assert(kFrames * kFrameSize == 1024, "one full receive buffer");

// 64 bare headers with command numbers 37, 38, ... (none of them has an action).
struct Datagram {
  alignas(4) uint8_t bytes[kFrames * kFrameSize];
  Datagram() {
    for (int i = 0; i < kFrames; ++i) {
      nlmsghdr hdr;
      memset(&hdr, 0, sizeof hdr);
      hdr.nlmsg_len = kFrameSize;
      hdr.nlmsg_type = static_cast<uint16_t>(37 + i);
      memcpy(bytes + i * kFrameSize, &hdr, sizeof hdr);
    }
  }
};

void null_logger(const struct __android_logger_data*, const char*) {}

enum Sink { kNullSink = 0, kStderrSink = 1 };

// Sets the logger for one benchmark; with the stderr sink, stderr points at /dev/null until the
// benchmark ends.
class SinkScope {
 public:
  explicit SinkScope(int sink) {
    if (sink == kStderrSink) {
      fflush(stderr);
      saved_stderr_ = dup(2);
      const int null_fd = open("/dev/null", O_WRONLY | O_CLOEXEC);
      dup2(null_fd, 2);
      close(null_fd);
      __android_log_set_logger(__android_log_stderr_logger);
    } else {
      __android_log_set_logger(null_logger);
    }
  }
  ~SinkScope() {
    __android_log_set_logger(__android_log_stderr_logger);
    if (saved_stderr_ >= 0) {
      fflush(stderr);
      dup2(saved_stderr_, 2);
      close(saved_stderr_);
    }
  }

 private:
  int saved_stderr_ = -1;
};

void BM_FrameWalkDaemon(benchmark::State& state) {
  const Datagram datagram;
  SinkScope sink(static_cast<int>(state.range(0)));
  for (auto _ : state) {
    process_message(datagram.bytes, sizeof datagram.bytes);
  }
  state.SetItemsProcessed(state.iterations() * kFrames);
}

// The limit: the walk of netlink(7) written bare, with the one required line per frame.
void BM_FrameWalkBareWithLog(benchmark::State& state) {
  const Datagram datagram;
  SinkScope sink(static_cast<int>(state.range(0)));
  for (auto _ : state) {
    const uint8_t* buffer = datagram.bytes;
    int32_t left = sizeof datagram.bytes;
    while (left >= static_cast<int32_t>(sizeof(nlmsghdr))) {
      nlmsghdr hdr;
      memcpy(&hdr, buffer, sizeof hdr);
      if (hdr.nlmsg_len < sizeof hdr || hdr.nlmsg_len > static_cast<uint32_t>(left)) break;
      KLOGI("%s: %d", "process_message", hdr.nlmsg_type);
      left -= static_cast<int32_t>(NLMSG_ALIGN(hdr.nlmsg_len));
      buffer += NLMSG_ALIGN(hdr.nlmsg_len);
    }
  }
  state.SetItemsProcessed(state.iterations() * kFrames);
}

// The walk alone, without any line: what the log costs on top of it.
void BM_FrameWalkBareNoLog(benchmark::State& state) {
  const Datagram datagram;
  for (auto _ : state) {
    const uint8_t* buffer = datagram.bytes;
    benchmark::DoNotOptimize(buffer);
    int32_t left = sizeof datagram.bytes;
    uint32_t sum = 0;
    while (left >= static_cast<int32_t>(sizeof(nlmsghdr))) {
      nlmsghdr hdr;
      memcpy(&hdr, buffer, sizeof hdr);
      if (hdr.nlmsg_len < sizeof hdr || hdr.nlmsg_len > static_cast<uint32_t>(left)) break;
      sum += hdr.nlmsg_type;
      left -= static_cast<int32_t>(NLMSG_ALIGN(hdr.nlmsg_len));
      buffer += NLMSG_ALIGN(hdr.nlmsg_len);
    }
    benchmark::DoNotOptimize(sum);
  }
  state.SetItemsProcessed(state.iterations() * kFrames);
}

BENCHMARK(BM_FrameWalkDaemon)->Arg(kNullSink)->Arg(kStderrSink);
BENCHMARK(BM_FrameWalkBareWithLog)->Arg(kNullSink)->Arg(kStderrSink);
BENCHMARK(BM_FrameWalkBareNoLog);

void summarize(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  auto per_frame = [&](const std::string& name) { return median_real_ns(runs, name) / kFrames; };
  const char* sinks[] = {"no-op logger", "stderr logger on /dev/null"};
  for (int sink = 0; sink < 2; ++sink) {
    const std::string arg = "/" + std::to_string(sink);
    const double daemon = per_frame("BM_FrameWalkDaemon" + arg);
    const double bare = per_frame("BM_FrameWalkBareWithLog" + arg);
    summary->add({std::string("frame walk, ignored frame, ") + sinks[sink], format_ns(daemon),
                  "bare walk + the same line " + format_ns(bare), format_ratio(daemon / bare), "-",
                  "-"});
  }
  const double bare_walk = per_frame("BM_FrameWalkBareNoLog");
  summary->add(
      {"frame walk without any log line (bare)", format_ns(bare_walk), "-", "-", "-", "-"});
  summary->note(
      "Per frame: the time for the 1024-byte datagram divided by its 64 frames; "
      "medians over the repetitions.");
  summary->note(
      "Every frame writes one line through liblog, which formats it (vsnprintf) even "
      "for a logger that drops it; the stderr logger adds the time stamp, the pid and "
      "tid and one write to stderr per line.");
}

}  // namespace

int main(int argc, char** argv) {
  return kestrel_bench::run_benchmarks(argc, argv, "Frame walk", summarize);
}
