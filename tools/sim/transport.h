// SPDX-License-Identifier: Apache-2.0
// The ways the library's connections reach the simulator: a Unix socket that a thread of the
// simulator listens on and reads, or the library in this process, which hands each record over
// on its caller's thread. Each connection's far end is a Channel; the simulator's core sees only
// channels and records, whichever transport carries them.
#pragma once

#include <stdint.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "sensor1_wire.h"

namespace kestrel_sim {

using Bytes = std::vector<uint8_t>;

// The far end of one connection: how records reach the library and how the simulator ends it.
class Channel {
 public:
  virtual ~Channel() = default;
  // Sends the records that make returns, in order and none interleaved with another sender's;
  // make runs inside that order, so what it decides still holds when its records go out. False
  // when the connection could not take them.
  virtual bool send_made(const std::function<std::vector<Bytes>()>& make) = 0;
  // Ends the connection from the simulator's side: the library sees it end.
  virtual void hang_up() = 0;
  // True when the library acknowledges a FAULT record with a record of its own; false when the
  // fault is in force before the library call in progress returns.
  virtual bool acknowledges_faults() const = 0;

  bool send(const Bytes& record) {
    return send_made([&] { return std::vector<Bytes>{record}; });
  }
};

struct Conn;
using ConnPtr = std::shared_ptr<Conn>;

// What a transport hands its connections and their records to.
class ConnectionSink {
 public:
  virtual ConnPtr add(std::unique_ptr<Channel> channel) = 0;
  virtual void handle(const ConnPtr& conn, const sensor1_wire::Record& record) = 0;
  // The connection has ended (end of file, a malformed stream, the library's close).
  virtual void end(const ConnPtr& conn) = 0;
  virtual bool ended(const ConnPtr& conn) const = 0;
  // Runs the hook of an ended connection and forgets it; on the transport's reading thread.
  virtual void reap(const ConnPtr& conn) = 0;

 protected:
  ~ConnectionSink() = default;
};

class Transport {
 public:
  virtual ~Transport() = default;  // closes what it still holds
  // Starts taking connections.
  virtual void start() = 0;
  // Takes no record once it returns.
  virtual void stop() = 0;
  // A connection has ended: the transport reaps it on its reading thread.
  virtual void retire(const ConnPtr& conn) = 0;
  // True on the thread that reads the connections.
  virtual bool on_reading_thread() const = 0;
  virtual bool listening() const = 0;
  virtual void stop_listening() = 0;
  virtual void resume_listening() = 0;
};

// Listens on path (a stale file is removed) and reads every connection on one thread.
std::unique_ptr<Transport> socket_transport(ConnectionSink& sink, const std::string& path);
// Becomes the in-process peer of the sensor1 library from start() to stop().
std::unique_ptr<Transport> in_process_transport(ConnectionSink& sink);

}  // namespace kestrel_sim
