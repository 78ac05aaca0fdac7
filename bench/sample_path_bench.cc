// SPDX-License-Identifier: Apache-2.0
// The sample path: one sample indication through the service callback, its conversion and its
// kernel frame sent onto a real netlink socket, set against a bare sendmsg of the same 32-byte
// frame on the same socket; and the conversion alone.
//
// The kernel side is a netlink socket bound to the kernel's port id in the same network
// namespace. Frames go out in timed batches of 64; between batches (untimed) the kernel side
// receives every frame of the batch, so the socket buffer never fills and no send waits. Nobody
// sleeps on the kernel side's socket while a batch is timed, so a send costs no wake-up of
// another thread: on the phone the kernel takes the frame inside the send, and no reader wakes
// either.
#include <linux/netlink.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/uio.h>

#include <cmath>
#include <memory>

#include "bench/bench_support.h"
#include "kernel_channel/netlink_channel.h"
#include "kernel_frame.h"
#include "sensor1.h"
#include "sensor1_host.h"
#include "sensor1_messages.h"
#include "service_link/connection.h"
#include "service_link/sample_conversion.h"
#include "service_link/service_callback.h"
#include "tools/sim/simulator.h"

namespace {

using kestrel_bench::NetlinkPort;

// An accelerometer sample of a phone lying flat: gravity on z (Q16 m/s^2).
constexpr int32_t kX = 3277;
constexpr int32_t kY = -2621;
constexpr int32_t kZ = 642908;

struct Channel {
  NetlinkPort kernel{kestrel_bench::kKernelPort};
  int fd = -1;
};

// The daemon's own netlink socket (open_and_bind_socket) and the kernel side, made once.
Channel& channel() {
  static Channel* c = [] {
    auto* made = new Channel;
    made->fd = open_and_bind_socket();
    set_kernel_channel(made->fd);
    init_callback_locks();
    return made;
  }();
  return *c;
}

bool channel_ready(benchmark::State& state) {
  Channel& c = channel();
  if (!c.kernel.ok() || c.fd < 0) {
    state.SkipWithError("netlink sockets could not be bound");
    return false;
  }
  return true;
}

// Frames a timed batch sends.
constexpr int kBatch = 64;

// Runs send() kBatch times per iteration and times the batch; then the kernel side receives the
// batch. A netlink send to a port of the same namespace is queued before sendmsg returns, so
// every frame of the batch is there to receive.
template <typename Send>
void run_batches(benchmark::State& state, Send send) {
  NetlinkPort& kernel = channel().kernel;
  kernel.drain(FRAME_SAMPLE);
  std::vector<double> batches;
  batches.reserve(1 << 16);
  for (auto _ : state) {
    const int64_t start = kestrel_bench::now_ns();
    for (int i = 0; i < kBatch; ++i) send();
    const int64_t end = kestrel_bench::now_ns();
    state.SetIterationTime(static_cast<double>(end - start) * 1e-9);
    batches.push_back(static_cast<double>(end - start));
    if (kernel.drain(FRAME_SAMPLE) != kBatch) {
      state.SkipWithError("a frame of the batch did not reach the kernel side");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations() * kBatch);
  // The typical batch: on a shared machine the mean also carries the batches that lost the core.
  state.counters["p50_frame_ns"] = kestrel_bench::median(batches) / kBatch;
}

// rcv_test_msg with a sample indication, exactly as the sensor1 library's thread delivers it: a
// header on the stack and a body from the library's allocator, which the callback frees.
void BM_SamplePathDaemon(benchmark::State& state) {
  if (!channel_ready(state)) return;
  const std::vector<uint8_t> body = kestrel_sim::sample_indication_body(kSmgrAccel, 0, kX, kY, kZ);
  const intptr_t cb_data = sensor1_callback_data();
  uint8_t txn = 0;
  run_batches(state, [&] {
    sensor1_msg_header_s hdr;
    hdr.service_number = kServiceSmgr;
    hdr.msg_id = kMsgSmgrSample;
    hdr.msg_size = static_cast<uint16_t>(body.size());
    hdr.txn_id = txn++;
    void* msg = sensor1_host_alloc_body(body.size());
    memcpy(msg, body.data(), body.size());
    rcv_test_msg(cb_data, &hdr, SENSOR1_MSG_TYPE_IND, msg);
  });
  if (sensor1_host_outstanding_bodies() != 0) state.SkipWithError("a body was not released");
}

// The limit: the same 32-byte frame, built once, sent with one sendmsg on the same socket to the
// same port id.
void BM_SamplePathBareSendmsg(benchmark::State& state) {
  if (!channel_ready(state)) return;
  sample_frame payload;
  convert_sample(kSmgrAccel, 0, kX, kY, kZ, mag_sensitivity_values{}, &payload);
  uint8_t frame[32];
  nlmsghdr hdr;
  hdr.nlmsg_len = sizeof frame;
  hdr.nlmsg_type = FRAME_SAMPLE;
  hdr.nlmsg_flags = 0;
  hdr.nlmsg_seq = 0;
  hdr.nlmsg_pid = kDaemonPortId;
  memcpy(frame, &hdr, sizeof hdr);
  memcpy(frame + sizeof hdr, &payload, sizeof payload);
  sockaddr_nl to;
  memset(&to, 0, sizeof to);
  to.nl_family = AF_NETLINK;
  to.nl_pid = kestrel_bench::kKernelPort;
  iovec iov = {frame, sizeof frame};
  msghdr msg;
  memset(&msg, 0, sizeof msg);
  msg.msg_name = &to;
  msg.msg_namelen = sizeof to;
  msg.msg_iov = &iov;
  msg.msg_iovlen = 1;
  const int fd = channel().fd;
  run_batches(state, [&] { benchmark::DoNotOptimize(sendmsg(fd, &msg, 0)); });
}

// convert_sample alone, over the rows a stream uses: accelerometer, gyroscope, magnetometer.
void BM_ConvertSample(benchmark::State& state) {
  const uint8_t sensor = static_cast<uint8_t>(state.range(0));
  mag_sensitivity_values sensitivity;
  sensitivity.x = 1.0f;
  sensitivity.y = 1.0f;
  sensitivity.z = 1.0f;
  int32_t x = kX;
  sample_frame frame;
  for (auto _ : state) {
    benchmark::DoNotOptimize(x);
    convert_sample(sensor, 0, x, kY, kZ, sensitivity, &frame);
    benchmark::DoNotOptimize(frame);
    ++x;
  }
}

// The four heap blocks send_to_kernel takes for every frame, as it takes them: message header,
// netlink address, I/O vector and the 32-byte frame buffer, freed buffer first.
void BM_FrameBlocks(benchmark::State& state) {
  for (auto _ : state) {
    void* msgh = malloc(sizeof(msghdr));
    void* addr = malloc(sizeof(sockaddr_nl));
    void* iov = malloc(sizeof(iovec));
    void* buf = malloc(frame_space(sizeof(sample_frame)));
    benchmark::DoNotOptimize(msgh);
    benchmark::DoNotOptimize(addr);
    benchmark::DoNotOptimize(iov);
    benchmark::DoNotOptimize(buf);
    free(buf);
    free(iov);
    free(addr);
    free(msgh);
  }
}

BENCHMARK(BM_SamplePathDaemon)->UseManualTime();
BENCHMARK(BM_SamplePathBareSendmsg)->UseManualTime();
BENCHMARK(BM_ConvertSample)->Arg(kSmgrAccel)->Arg(kSmgrGyro)->Arg(kSmgrMag);
BENCHMARK(BM_FrameBlocks);

void summarize(const kestrel_bench::RunRecords& runs, kestrel_bench::Summary* summary) {
  using namespace kestrel_bench;
  auto ns = [&](const std::string& name) { return median_real_ns(runs, name); };
  // Each repetition's real time is the mean over its batches; their mean over the repetitions.
  auto mean_ns = [&](const std::string& name) { return mean_real_ns(runs, name); };
  const double daemon = counter(runs, "BM_SamplePathDaemon", "p50_frame_ns");
  const double bare = counter(runs, "BM_SamplePathBareSendmsg", "p50_frame_ns");
  const double ratio = daemon / bare;
  const double daemon_mean = mean_ns("BM_SamplePathDaemon") / kBatch;
  const double bare_mean = mean_ns("BM_SamplePathBareSendmsg") / kBatch;
  summary->add({"sample path: indication to kernel frame, median", format_ns(daemon),
                "bare sendmsg of the frame " + format_ns(bare), format_ratio(ratio), "<= 1.25x",
                verdict(ratio <= 1.25, !std::isnan(ratio))});
  summary->add({"  the same, mean", format_ns(daemon_mean), "bare sendmsg " + format_ns(bare_mean),
                format_ratio(daemon_mean / bare_mean), "-", "-"});
  const char* rows[] = {"accelerometer", "gyroscope", "magnetometer"};
  const int ids[] = {kSmgrAccel, kSmgrGyro, kSmgrMag};
  for (int i = 0; i < 3; ++i) {
    const double convert = ns("BM_ConvertSample/" + std::to_string(ids[i]));
    summary->add({std::string("convert_sample, ") + rows[i], format_ns(convert),
                  "share of the sample path " + format_number(100 * convert / daemon, 1) + " %",
                  "-", "-", "-"});
  }
  const double blocks = ns("BM_FrameBlocks");
  summary->add({"send_to_kernel's four heap blocks, allocated and freed", format_ns(blocks),
                "share of the sample path " + format_number(100 * blocks / daemon, 1) + " %", "-",
                "-", "-"});
  summary->note(
      "Per frame: the time of a batch of 64 divided by 64. Median: the median batch of a "
      "repetition, then the median over the repetitions; mean: the mean batch over all the "
      "repetitions. The daemon's path and the bare sendmsg ran interleaved, on the same socket, "
      "to the same kernel side.");
  summary->note(
      "Beyond the bare send, the daemon's path allocates and frees the body (the "
      "library's), takes indication_lock, converts, and allocates and frees the four "
      "blocks of send_to_kernel (msghdr, sockaddr_nl, iovec, frame buffer).");
}

}  // namespace

int main(int argc, char** argv) {
  kestrel_bench::enter_private_network_namespace(argc, argv);
  return kestrel_bench::run_benchmarks(argc, argv, "Sample path", summarize);
}
