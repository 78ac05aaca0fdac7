#include "capture.h"

#include <arpa/inet.h>
#include <pcap/pcap.h>
#include <string.h>

#include <algorithm>

namespace kestrelctl {
namespace {

constexpr int kSnapshotLength = 262144;  // tcpdump's default
constexpr uint16_t kPacketHost = 0;      // received
constexpr uint16_t kPacketOutgoing = 4;  // sent

void store_be16(uint8_t* p, uint16_t v) {
  const uint16_t n = htons(v);
  memcpy(p, &n, sizeof n);
}

uint16_t load_be16(const uint8_t* p) {
  uint16_t n;
  memcpy(&n, p, sizeof n);
  return ntohs(n);
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
  if (pcap_ != nullptr) pcap_close(pcap_);
}

bool CaptureReader::open(const std::string& path, std::string* error) {
  char message[PCAP_ERRBUF_SIZE] = "";
  pcap_ = pcap_open_offline(path.c_str(), message);
  if (pcap_ == nullptr) {
    *error = "cannot read the capture " + path + ": " + message;
    return false;
  }
  if (pcap_datalink(pcap_) != DLT_NETLINK) {
    const char* name = pcap_datalink_val_to_name(pcap_datalink(pcap_));
    *error = path + " is no netlink capture: its link type is " +
             (name != nullptr ? name : std::to_string(pcap_datalink(pcap_))) +
             ", not NETLINK (take it on an nlmon interface)";
    return false;
  }
  return true;
}

CaptureReader::Next CaptureReader::next(CapturedPacket* packet, std::string* error) {
  struct pcap_pkthdr* header = nullptr;
  const u_char* data = nullptr;
  const int r = pcap_next_ex(pcap_, &header, &data);
  if (r == PCAP_ERROR_BREAK) return Next::kEnd;
  const std::string name = "packet " + std::to_string(count_ + 1);
  if (r != 1) {
    *error = name + ": " + pcap_geterr(pcap_);
    return Next::kError;
  }
  ++count_;
  if (header->caplen < kCaptureHeaderSize) {
    *error = name + " holds " + std::to_string(header->caplen) +
             " bytes, fewer than its 16-byte netlink header";
    return Next::kError;
  }
  packet->number = count_;
  packet->time = header->ts;
  packet->arphrd = load_be16(data + 2);
  packet->protocol = load_be16(data + 14);
  packet->original_size =
      std::max(header->len, header->caplen) - static_cast<uint32_t>(kCaptureHeaderSize);
  packet->datagram.assign(data + kCaptureHeaderSize, data + header->caplen);
  return Next::kPacket;
}

}  // namespace kestrelctl
