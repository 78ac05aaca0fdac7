// SPDX-License-Identifier: Apache-2.0
// The records the host build's sensor1 library and kestrel-sim exchange on a Unix stream socket,
// in both directions:
//
//   u32 length (bytes that follow) | u8 kind | fields of the kind
//
// with a message header HDR = u32 service, i32 msg_id, u16 msg_size, u8 txn_id, u8 0, followed
// by msg_size body bytes. Every field is little-endian. The library writes OPEN, WRITE and
// FAULT_ACK; the simulator writes OPEN_RESULT, RESPONSE, INDICATION, RETRY_OPEN, FAULT and
// CALLBACK.
#pragma once

#include <stddef.h>
#include <stdint.h>

#include <functional>
#include <vector>

namespace sensor1_wire {

enum Kind : uint8_t {
  kOpen = 1,         // no fields
  kWrite = 2,        // HDR + body
  kFaultAck = 3,     // u8 operation
  kOpenResult = 64,  // i32 result
  kResponse = 65,    // HDR + body
  kIndication = 66,  // HDR + body
  kRetryOpen = 67,   // no fields
  kFault = 68,       // u8 operation, i32 result, u32 count
  kCallback = 69,    // i32 message type, u8 flags, HDR + body
};

// The library calls a FAULT record applies to.
enum class FaultOp : uint8_t { kAlloc = 1, kWrite = 2, kClose = 3 };

// Flags of a CALLBACK record: which of header and body the callback gets.
constexpr uint8_t kWithHeader = 1;
constexpr uint8_t kWithBody = 2;

constexpr size_t kLengthSize = 4;
constexpr size_t kHdrSize = 12;
constexpr size_t kMaxBody = 65535;
// Largest record either side accepts: a CALLBACK with a full 16-bit body.
constexpr uint32_t kMaxRecord = 1 + 5 + kHdrSize + kMaxBody;

struct Header {
  uint32_t service = 0;
  int32_t msg_id = 0;
  uint16_t msg_size = 0;
  uint8_t txn_id = 0;
};

// One record. Which fields it carries depends on the kind; the others stay as they are.
struct Record {
  uint8_t kind = 0;
  Header header;                  // WRITE, RESPONSE, INDICATION, CALLBACK
  const uint8_t* body = nullptr;  // header.msg_size bytes; when parsed, inside the parsed buffer
  int32_t value = 0;              // OPEN_RESULT and FAULT: result; CALLBACK: message type
  uint8_t op = 0;                 // FAULT and FAULT_ACK: the FaultOp
  uint8_t flags = 0;              // CALLBACK
  uint32_t count = 0;             // FAULT
};

// A record of a kind without fields, of HDR + body, or of one result.
Record plain(Kind kind);
Record message(Kind kind, Header header, const uint8_t* body, size_t size);
Record result(Kind kind, int32_t value);

// Appends the record, length first.
void append(const Record& record, std::vector<uint8_t>* out);
std::vector<uint8_t> encode(const Record& record);

// Parses the record at the start of data. Returns the bytes it spans, length included; 0 when
// size does not hold all of it yet; -1 when the stream is malformed: a length of 0 or above
// kMaxRecord, or fields that are not exactly those of the kind (a HDR whose msg_size disagrees
// with the bytes that follow, a pad byte that is not 0). A kind not listed above parses, its
// fields unread.
long parse(const uint8_t* data, size_t size, Record* record);

// Sends every byte (no SIGPIPE), retrying after signals. False once the connection is gone.
bool send_all(int fd, const uint8_t* data, size_t size);

// Appends to rx what the socket holds, without waiting. Returns 1 when bytes came, 0 when none
// were there, -1 when the connection has ended (end of file or an error).
int receive_available(int fd, std::vector<uint8_t>* rx);

// Connects to the simulator at path and does the OPEN handshake, waiting at most timeout_seconds
// for OPEN_RESULT (the wait starts again with each record before it); exactly the records up to
// it are read. Records that come ahead of OPEN_RESULT go to early, whole, as they arrive; without
// early they end the handshake. Returns the connected descriptor, or -1 with *result the
// simulator's non-zero answer, or 11 when the socket does not exist, refuses the connection or
// does not answer.
int connect_and_open(const char* path, int timeout_seconds, int32_t* result,
                     const std::function<void(std::vector<uint8_t>)>& early = nullptr);

}  // namespace sensor1_wire
