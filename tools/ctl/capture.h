// SPDX-License-Identifier: Apache-2.0
// Captures of the kernel channel, in the pcap format tcpdump writes on a netlink monitor (nlmon)
// device, so that a capture taken on a workstation and one taken on the phone read alike in
// kestrelctl, tcpdump, tshark and Wireshark. libpcap writes and reads the files.
//
// The files kestrelctl writes have link type LINKTYPE_NETLINK (253). Each packet is one datagram
// behind a 16-byte header, every field in network byte order:
//
//   offset 0   u16  packet type: 4 for a datagram the kernel's side sent, 0 for one it received
//   offset 2   u16  ARPHRD type, 824 (netlink)
//   offset 4   u16  link-layer address length, 0
//   offset 6   8    link-layer address, zeros
//   offset 14  u16  netlink protocol
//
// libpcap writes the file header (magic, version, snapshot length, link type) and each packet's
// time stamp and lengths; the 16-byte header is ours. The host build talks netlink protocol 2
// (NETLINK_USERSOCK) where the phone talks 23, but its captures say 23, as the phone's would: the
// frames are the same, and so is everything that reads them.
//
// The reader also takes what tcpdump writes on the "any" interface: LINKTYPE_LINUX_SLL (113),
// the same 16-byte header, and LINKTYPE_LINUX_SLL2 (276), a 20-byte one:
//
//   offset 0   u16  protocol (the netlink protocol when the ARPHRD type is 824)
//   offset 2   u16  reserved
//   offset 4   u32  interface index
//   offset 8   u16  ARPHRD type
//   offset 10  u8   packet type
//   offset 11  u8   link-layer address length
//   offset 12  8    link-layer address
//
// Packets of any other link type carry no netlink; they are read, and counted by whoever skips
// them. The same reader takes packets live from an interface.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/time.h>

#include <string>
#include <vector>

struct pcap;
struct pcap_dumper;

namespace kestrelctl {

constexpr uint16_t kCaptureProtocol = 23;  // the factory driver's netlink protocol
constexpr uint16_t kArphrdNetlink = 824;
constexpr size_t kCaptureHeaderSize = 16;

class CaptureWriter {
 public:
  CaptureWriter() = default;
  ~CaptureWriter();
  CaptureWriter(const CaptureWriter&) = delete;
  CaptureWriter& operator=(const CaptureWriter&) = delete;

  // Appends to the capture at path, or starts it when there is none, so that the commands of a
  // session gather in one file. A file that is not a netlink capture is refused.
  bool open(const std::string& path, std::string* error);

  // One datagram with its time, on disk when this returns. After a failure the capture takes
  // nothing more and error() says why.
  void write(const uint8_t* data, size_t size, bool sent_by_kernel, const struct timeval& time);

  bool is_open() const { return dumper_ != nullptr; }
  const std::string& error() const { return error_; }

 private:
  struct pcap* pcap_ = nullptr;
  struct pcap_dumper* dumper_ = nullptr;
  std::string path_;
  std::string error_;
};

struct CapturedPacket {
  uint64_t number = 0;  // 1 for the first packet of the file, as tshark counts
  struct timeval time = {};
  uint16_t arphrd = 0;
  uint16_t protocol = 0;
  uint32_t original_size = 0;     // of the datagram when it was captured
  std::vector<uint8_t> datagram;  // the bytes the file holds, at most original_size
};

class CaptureReader {
 public:
  CaptureReader() = default;
  ~CaptureReader();
  CaptureReader(const CaptureReader&) = delete;
  CaptureReader& operator=(const CaptureReader&) = delete;

  bool open(const std::string& path, std::string* error);
  // Packets as they pass an interface (an nlmon device, or "any"), each as soon as it is seen.
  bool open_live(const std::string& interface, std::string* error);
  // Also writes every packet read, with the link type it has, to the capture at path; appends
  // when the file is a capture of that link type already.
  bool keep(const std::string& path, std::string* error);

  // "NETLINK", "LINUX_SLL", ... or the number of a link type libpcap has no name for.
  std::string link_type_name() const;
  // Whether packets of this link type can hold netlink datagrams.
  bool carries_netlink() const;

  enum class Next { kPacket, kEnd, kError };
  // The next packet. kError names the packet that could not be read: the file ends inside it,
  // or it is too short for its link-layer header. Live, it waits for one until timeout_ms
  // (-1: no limit) has passed or a signal has come (both kEnd).
  Next next(CapturedPacket* packet, std::string* error, int timeout_ms = -1);

 private:
  Next wait_live(int timeout_ms, std::string* error);

  struct pcap* pcap_ = nullptr;
  struct pcap_dumper* dumper_ = nullptr;
  bool live_ = false;
  uint64_t count_ = 0;
};

}  // namespace kestrelctl
