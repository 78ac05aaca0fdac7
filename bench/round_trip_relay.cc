// SPDX-License-Identifier: Apache-2.0
// The relays of the command round trip (round_trip_bench starts them): relay i takes an
// accelerometer self test from its kernel side, writes the request record to its simulator, waits
// for the indication and sends the type-9 reply back. With no duties that is all: no threads, no
// logging, no allocation per command. Its duties (round_trip_relay.h) add what the daemon does on
// the way:
//   - log lines: the records the daemon itself wrote for a self test (read from the file
//     round_trip_bench took them into), replayed through liblog's stderr logger at the points
//     where the daemon writes them: its main thread's records before the write to the phone and
//     once the answer is in, the library thread's records when the indication is read;
//   - hand-over: a reader thread takes the records and hands the indication to the main thread
//     waiting on a condition variable, as the sensor1 library's thread hands it to the command
//     waiting on command_waiter;
//   - response record: its simulator answers with a response and then the indication, as the
//     sensor service answers a self test.
//
// Usage: round_trip_relay <index> <simulator socket> [<records file>]
#include <errno.h>
#include <linux/netlink.h>
#include <poll.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "bench/round_trip_relay.h"
#include "bench/selftest_log.h"
#include "byte_order.h"
#include "kernel_frame.h"
#include "kestrel_log.h"
#include "kestrel_platform.h"
#include "sensor1_messages.h"
#include "sensor1_wire.h"

namespace {

using namespace kestrel_bench;

// The daemon's records of a self test, split where it writes them.
struct Replay {
  std::vector<ReplayedRecord> before;   // the main thread's, before the write to the phone
  std::vector<ReplayedRecord> library;  // the library thread's, for the indication
  std::vector<ReplayedRecord> after;    // the main thread's, once the answer is in

  explicit Replay(const std::vector<ReplayedRecord>& records) {
    for (const ReplayedRecord& r : records) {
      (!r.main_thread ? library : library.empty() ? before : after).push_back(r);
    }
  }
  void log(const std::vector<ReplayedRecord>& records) const {
    for (const ReplayedRecord& r : records) {
      __android_log_print(r.priority, LOG_TAG, "%s", r.message.c_str());
    }
  }
};

// WRITE of the 12-byte self-test request (SensorID 0, TestType 6), as the daemon writes it.
std::vector<uint8_t> write_record() {
  uint8_t request[12] = {};
  store_u32(request, 4, 6);
  return sensor1_wire::encode(sensor1_wire::message(
      sensor1_wire::kWrite, {kServiceSmgr, kMsgSmgrSingleSensorTest, 0, kTxnSingleSensorTest},
      request, sizeof request));
}

// Reads whole records from the simulator and keeps the words of the latest indication.
class RecordReader {
 public:
  explicit RecordReader(int fd) : fd_(fd), rx_(64 * 1024) {}
  // Reads what the socket holds (waiting for it when block is set) and returns true once an
  // indication has been taken; responses are passed over, as the daemon's callback passes over a
  // successful self-test response. Ends the process when the simulator goes away.
  bool read(bool block, const Replay* replay) {
    const ssize_t got = recv(fd_, rx_.data() + have_, rx_.size() - have_, block ? 0 : MSG_DONTWAIT);
    if (got <= 0) {
      if (got < 0 && (errno == EAGAIN || errno == EINTR)) return false;
      _exit(0);
    }
    have_ += static_cast<size_t>(got);
    bool indication = false;
    size_t pos = 0;
    sensor1_wire::Record rec;
    for (long span; (span = sensor1_wire::parse(rx_.data() + pos, have_ - pos, &rec)) > 0;
         pos += static_cast<size_t>(span)) {
      if (rec.kind == sensor1_wire::kIndication && rec.header.msg_size >= 84) {
        memcpy(words, rec.body + kTestIndWordsOffset, sizeof words);
        if (replay != nullptr) replay->log(replay->library);
        indication = true;
      }
    }
    memmove(rx_.data(), rx_.data() + pos, have_ - pos);
    have_ -= pos;
    return indication;
  }

  uint8_t words[32] = {};

 private:
  int fd_;
  std::vector<uint8_t> rx_;
  size_t have_ = 0;
};

// The hand-over from the reader thread to the main thread, as command_waiter does it.
struct HandOver {
  pthread_mutex_t mutex = PTHREAD_MUTEX_INITIALIZER;
  pthread_cond_t cond = PTHREAD_COND_INITIALIZER;
  bool arrived = false;
  uint8_t words[32] = {};
  RecordReader* reader = nullptr;
  int fd = -1;
  const Replay* replay = nullptr;
};

// The sensor1 library's part: wait for the socket, read what is there, and raise the waiter for
// each indication.
void* hand_over_reader(void* arg) {
  HandOver* h = static_cast<HandOver*>(arg);
  for (;;) {
    pollfd p = {h->fd, POLLIN, 0};
    if (poll(&p, 1, -1) <= 0) continue;
    if (!h->reader->read(/*block=*/false, h->replay)) continue;
    pthread_mutex_lock(&h->mutex);
    memcpy(h->words, h->reader->words, sizeof h->words);
    h->arrived = true;
    pthread_cond_signal(&h->cond);
    pthread_mutex_unlock(&h->mutex);
  }
  return nullptr;
}

// Waits for the hand-over with the daemon's 8-second deadline on the wall clock and copies the
// words out.
void wait_for_hand_over(HandOver* h, uint8_t (&words)[32]) {
  timeval now;
  gettimeofday(&now, nullptr);
  timespec deadline = {now.tv_sec + 8, now.tv_usec * 1000};
  pthread_mutex_lock(&h->mutex);
  while (!h->arrived && pthread_cond_timedwait(&h->cond, &h->mutex, &deadline) == 0) {
  }
  h->arrived = false;
  memcpy(words, h->words, sizeof words);
  pthread_mutex_unlock(&h->mutex);
}

// The type-9 reply from the indication's first eight result words.
void build_reply(uint32_t port, const uint8_t (&words)[32], uint8_t (&reply)[16 + 72]) {
  memset(reply, 0, sizeof reply);
  nlmsghdr hdr;
  memset(&hdr, 0, sizeof hdr);
  hdr.nlmsg_len = sizeof reply;
  hdr.nlmsg_type = FRAME_SELFTEST;
  hdr.nlmsg_pid = port;
  memcpy(reply, &hdr, sizeof hdr);
  memcpy(reply + 16 + 4, words, sizeof words);
}

// The sockets of relay i: its simulator's, and its netlink port bound. -1 on failure.
bool open_sockets(size_t i, const char* socket_path, int* sim, int* nl) {
  int32_t opened = 0;
  *sim = sensor1_wire::connect_and_open(socket_path, 10, &opened);
  *nl = socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, platform_netlink_protocol());
  sockaddr_nl own;
  memset(&own, 0, sizeof own);
  own.nl_family = AF_NETLINK;
  own.nl_pid = relay_port(i);
  return *sim >= 0 && *nl >= 0 && bind(*nl, reinterpret_cast<sockaddr*>(&own), sizeof own) == 0;
}

int run_relay(size_t i, const char* socket_path, const Replay* replay) {
  int sim = -1, nl = -1;
  if (!open_sockets(i, socket_path, &sim, &nl)) {
    fprintf(stderr, "relay: cannot set up its sockets\n");
    return 1;
  }
  sockaddr_nl kernel;
  memset(&kernel, 0, sizeof kernel);
  kernel.nl_family = AF_NETLINK;
  kernel.nl_pid = relay_kernel_port(i);
  static RecordReader reader(sim);
  static HandOver hand_over;
  const bool hands_over = (kRelays[i].duties & kHandOver) != 0;
  if (hands_over) {
    hand_over.reader = &reader;
    hand_over.fd = sim;
    hand_over.replay = replay;
    pthread_t thread;
    if (pthread_create(&thread, nullptr, hand_over_reader, &hand_over) != 0) return 1;
  }
  uint8_t datagram[1024];
  const std::vector<uint8_t> request = write_record();
  uint8_t words[32];
  uint8_t reply[16 + 72];
  for (;;) {
    if (recv(nl, datagram, sizeof datagram, 0) < 16) continue;
    if (replay != nullptr) replay->log(replay->before);
    if (!sensor1_wire::send_all(sim, request.data(), request.size())) return 1;
    if (hands_over) {
      wait_for_hand_over(&hand_over, words);
    } else {
      while (!reader.read(/*block=*/true, replay)) {
      }
      memcpy(words, reader.words, sizeof words);
    }
    if (replay != nullptr) replay->log(replay->after);
    build_reply(relay_port(i), words, reply);
    sendto(nl, reply, sizeof reply, 0, reinterpret_cast<sockaddr*>(&kernel), sizeof kernel);
  }
}

}  // namespace

int main(int argc, char** argv) {
  char* end = nullptr;
  const unsigned long i = argc >= 3 ? strtoul(argv[1], &end, 10) : kRelayCount;
  if (i >= kRelayCount || *end != '\0' || argc > 4) {
    fprintf(stderr, "usage: round_trip_relay <index> <simulator socket> [<records file>]\n");
    return 2;
  }
  const bool logs = (kRelays[i].duties & kLogLines) != 0;
  if (logs && argc != 4) {
    fprintf(stderr, "relay %lu replays the daemon's records: name their file\n", i);
    return 2;
  }
  const Replay replay(logs ? read_records(argv[3]) : std::vector<ReplayedRecord>{});
  return run_relay(i, argv[2], logs ? &replay : nullptr);
}
