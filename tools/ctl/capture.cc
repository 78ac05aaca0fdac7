// SPDX-License-Identifier: Apache-2.0
#include "capture.h"

#include <arpa/inet.h>
#include <errno.h>
#include <pcap/pcap.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <time.h>

#include <algorithm>

namespace kestrelctl {
namespace {

constexpr int kSnapshotLength = 262144;     // tcpdump's default
constexpr int kLiveSnapshotLength = 65535;  // more than any datagram of the channel
constexpr uint16_t kPacketHost = 0;         // received
constexpr uint16_t kPacketOutgoing = 4;     // sent

void store_be16(uint8_t* p, uint16_t v) {
  const uint16_t n = htons(v);
  memcpy(p, &n, sizeof n);
}

uint16_t load_be16(const uint8_t* p) {
  uint16_t n;
  memcpy(&n, p, sizeof n);
  return ntohs(n);
}

// Where a link type keeps the ARPHRD type and the protocol, and how long its header is.
struct LinkHeader {
  int link_type;
  size_t size;
  size_t arphrd_offset;
  size_t protocol_offset;
};

constexpr LinkHeader kLinkHeaders[] = {
    {DLT_NETLINK, kCaptureHeaderSize, 2, 14},
    {DLT_LINUX_SLL, 16, 2, 14},
    {DLT_LINUX_SLL2, 20, 8, 0},
};

const LinkHeader* link_header(int link_type) {
  for (const LinkHeader& h : kLinkHeaders) {
    if (h.link_type == link_type) return &h;
  }
  return nullptr;
}

}  // namespace

CaptureWriter::~CaptureWriter() {
  if (dumper_ != nullptr) pcap_dump_close(dumper_);
  if (pcap_ != nullptr) pcap_close(pcap_);
}

bool CaptureWriter::open(const std::string& path, std::string* error) {
  pcap_ = pcap_open_dead(DLT_NETLINK, kSnapshotLength);
  if (pcap_ == nullptr) {
    *error = "cannot start a capture";
    return false;
  }
  dumper_ = pcap_dump_open_append(pcap_, path.c_str());
  if (dumper_ == nullptr) {
    *error = "cannot write the capture " + path + ": " + pcap_geterr(pcap_);
    return false;
  }
  path_ = path;
  return true;
}

void CaptureWriter::write(const uint8_t* data, size_t size, bool sent_by_kernel,
                          const struct timeval& time) {
  if (dumper_ == nullptr || !error_.empty()) return;
  std::vector<uint8_t> packet(kCaptureHeaderSize + size, 0);
  store_be16(&packet[0], sent_by_kernel ? kPacketOutgoing : kPacketHost);
  store_be16(&packet[2], kArphrdNetlink);
  store_be16(&packet[14], kCaptureProtocol);
  if (size > 0) memcpy(&packet[kCaptureHeaderSize], data, size);
  struct pcap_pkthdr header = {};
  header.ts = time;
  header.caplen = header.len = static_cast<bpf_u_int32>(packet.size());
  pcap_dump(reinterpret_cast<u_char*>(dumper_), &header, packet.data());
  if (pcap_dump_flush(dumper_) != 0) error_ = "cannot write the capture " + path_;
}

CaptureReader::~CaptureReader() {
  if (dumper_ != nullptr) pcap_dump_close(dumper_);
  if (pcap_ != nullptr) pcap_close(pcap_);
}

bool CaptureReader::open(const std::string& path, std::string* error) {
  char message[PCAP_ERRBUF_SIZE] = "";
  pcap_ = pcap_open_offline(path.c_str(), message);
  if (pcap_ == nullptr) {
    *error = "cannot read the capture " + path + ": " + message;
    return false;
  }
  return true;
}

bool CaptureReader::open_live(const std::string& interface, std::string* error) {
  char message[PCAP_ERRBUF_SIZE] = "";
  pcap_ = pcap_create(interface.c_str(), message);
  const std::string what = "cannot capture on " + interface + ": ";
  if (pcap_ == nullptr) {
    *error = what + message;
    return false;
  }
  live_ = true;
  pcap_set_immediate_mode(pcap_, 1);
  pcap_set_snaplen(pcap_, kLiveSnapshotLength);
  const int r = pcap_activate(pcap_);
  if (r < 0) {
    const std::string status = pcap_statustostr(r);
    const std::string detail = pcap_geterr(pcap_);
    *error = what + (detail.empty() ? status : detail);
    return false;
  }
  if (pcap_setnonblock(pcap_, 1, message) != 0 || pcap_get_selectable_fd(pcap_) < 0) {
    *error = what + "it cannot be waited on";
    return false;
  }
  return true;
}

bool CaptureReader::keep(const std::string& path, std::string* error) {
  dumper_ = pcap_dump_open_append(pcap_, path.c_str());
  if (dumper_ == nullptr) {
    *error = "cannot write the capture " + path + ": " + pcap_geterr(pcap_);
    return false;
  }
  return true;
}

std::string CaptureReader::link_type_name() const {
  const char* name = pcap_datalink_val_to_name(pcap_datalink(pcap_));
  return name != nullptr ? name : std::to_string(pcap_datalink(pcap_));
}

bool CaptureReader::carries_netlink() const {
  return link_header(pcap_datalink(pcap_)) != nullptr;
}

// Until the interface has a packet, the time is up or SIGINT or SIGTERM comes. The caller keeps
// those two blocked while it is not waiting here, so that none slips in between its check of what
// the handler set and this wait.
CaptureReader::Next CaptureReader::wait_live(int timeout_ms, std::string* error) {
  sigset_t mask;
  pthread_sigmask(SIG_SETMASK, nullptr, &mask);
  sigdelset(&mask, SIGINT);
  sigdelset(&mask, SIGTERM);
  struct pollfd fd = {pcap_get_selectable_fd(pcap_), POLLIN, 0};
  struct timespec limit = {timeout_ms / 1000, (timeout_ms % 1000) * 1000000L};
  const int r = ppoll(&fd, 1, timeout_ms < 0 ? nullptr : &limit, &mask);
  if (r > 0) return Next::kPacket;
  if (r == 0 || errno == EINTR) return Next::kEnd;
  *error = std::string("cannot wait for packets: ") + strerror(errno);
  return Next::kError;
}

CaptureReader::Next CaptureReader::next(CapturedPacket* packet, std::string* error,
                                        int timeout_ms) {
  struct pcap_pkthdr* header = nullptr;
  const u_char* data = nullptr;
  int r = pcap_next_ex(pcap_, &header, &data);
  while (live_ && r == 0) {
    const Next waited = wait_live(timeout_ms, error);
    if (waited != Next::kPacket) return waited;
    r = pcap_next_ex(pcap_, &header, &data);
  }
  if (r == PCAP_ERROR_BREAK) return Next::kEnd;
  const std::string name = "packet " + std::to_string(count_ + 1);
  if (r != 1) {
    *error = name + ": " + pcap_geterr(pcap_);
    return Next::kError;
  }
  ++count_;
  if (dumper_ != nullptr) {
    pcap_dump(reinterpret_cast<u_char*>(dumper_), header, data);
    pcap_dump_flush(dumper_);
  }
  packet->number = count_;
  packet->time = header->ts;
  packet->arphrd = packet->protocol = 0;
  packet->original_size = std::max(header->len, header->caplen);
  packet->datagram.assign(data, data + header->caplen);
  const LinkHeader* link = link_header(pcap_datalink(pcap_));
  if (link == nullptr) return Next::kPacket;
  if (header->caplen < link->size) {
    *error = name + " holds " + std::to_string(header->caplen) + " bytes, fewer than its " +
             std::to_string(link->size) + "-byte " +
             (link->link_type == DLT_NETLINK ? "netlink" : "link-layer") + " header";
    return Next::kError;
  }
  packet->arphrd = load_be16(data + link->arphrd_offset);
  packet->protocol = load_be16(data + link->protocol_offset);
  packet->original_size -= static_cast<uint32_t>(link->size);
  packet->datagram.erase(packet->datagram.begin(), packet->datagram.begin() + link->size);
  return Next::kPacket;
}

}  // namespace kestrelctl
