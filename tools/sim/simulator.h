// SPDX-License-Identifier: Apache-2.0
// kestrel-sim: the simulated sensor processor. It serves the sensor1 wire protocol of the host
// build on a Unix stream socket. Tests drive it step by step (expect a request, answer it,
// inject a fault, drop the connection, refuse opens); the kestrel-sim program runs it as a
// healthy phone that answers every request of the daemon by itself.
#pragma once

#include <stdint.h>

#include <array>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "sensor1_wire.h"
#include "tools/sim/phone_bodies.h"  // the bodies tests send through the simulator

namespace kestrel_sim {

using FaultOp = sensor1_wire::FaultOp;
using Header = sensor1_wire::Header;  // msg_size is filled from the body when sent

// One sensor1_write of the daemon, as received.
struct Request {
  int connection = 0;  // 1 for the first connection of the simulator's life, then 2, ...
  Header header;
  std::vector<uint8_t> body;
};

using Millis = std::chrono::milliseconds;

class HealthyPhone;

class Simulator {
 public:
  // Listens on socket_path (a stale file is removed). With healthy set it answers every request
  // like a healthy phone (see healthy_phone.h); without it, only what a test tells it.
  explicit Simulator(std::string socket_path, bool healthy = false);
  // In process: from now on sensor1_open reaches this simulator in this process, on the caller's
  // thread (sensor1_host::use_in_process_peer), until it is destroyed. There is no socket and no
  // thread: a write gets its answers before it returns, fault() is applied before the library
  // call in progress returns and waits for nothing, and a stream sends one sample at its start.
  struct InProcess {};
  Simulator(InProcess, bool healthy = false);
  ~Simulator();  // stops its threads, closes every connection and removes the socket file
  Simulator(const Simulator&) = delete;
  Simulator& operator=(const Simulator&) = delete;

  const std::string& socket_path() const;

  void set_healthy(bool healthy);
  // The phone that answers when healthy is set: its knobs and its count of bad requests.
  HealthyPhone& phone();

  // The next count OPEN records are answered with result (11 EWOULDBLOCK, or any error code).
  void refuse_opens(int32_t result, int count);
  // The next count OPEN records are answered only after hold, or sooner on release_held_opens():
  // a slow service. The answer is held on the thread that reads the connection (the connection
  // thread, in process the opener's), so nothing else is read meanwhile and fault() times out.
  void hold_opens(Millis hold, int count);
  void release_held_opens();
  // True once an OPEN answer is being held, within timeout.
  bool wait_for_held_open(Millis timeout);
  // A callback record (as callback() builds it) to the connection whose OPEN answer is held now,
  // ahead of that answer: the library has it while its open is in progress, e.g. a broken pipe
  // (250) of a link that breaks while it is being opened. In process it comes right behind the
  // answer. False when no answer is held.
  bool callback_to_held_open(int32_t msg_type, bool with_header, bool with_body, Header header,
                             const std::vector<uint8_t>& body);

  // Stops accepting (the socket file is removed, so sensor1_open gets 11) or starts again.
  void stop_listening();
  void resume_listening();

  // Number of connections that completed the OPEN handshake with result 0, over the life. A
  // connection is counted, and is the current one, before its OPEN_RESULT goes out: once
  // sensor1_open has returned 0, records sent here reach that connection.
  int opened_connections() const;
  // True once a connection is open (the current one), within timeout.
  bool wait_for_connection(Millis timeout);
  // True once the current connection has ended (closed by the library or dropped).
  bool wait_for_disconnect(Millis timeout);

  // Every WRITE received so far, in arrival order, and the next one not yet taken.
  std::vector<Request> requests() const;
  std::optional<Request> next_request(Millis timeout);
  void clear_requests();

  // Records to the current connection. msg_size of the header is set from the body.
  void respond(Header header, const std::vector<uint8_t>& body);
  void indicate(Header header, const std::vector<uint8_t>& body);
  void retry_open();
  // A callback of exactly this type; with_header / with_body clear give null pointers.
  void callback(int32_t msg_type, bool with_header, bool with_body, Header header,
                const std::vector<uint8_t>& body);
  // The next count calls of op return result; waits for the FAULT_ACK. False on timeout.
  bool fault(FaultOp op, int32_t result, uint32_t count, Millis timeout = Millis(2000));
  // Closes the current connection from the simulator's side: the library sees end of file.
  void drop_connection();

  // False when the socket could not be bound (the reason went to stderr) or after
  // stop_listening().
  bool listening() const;
  // Number of the current connection, 0 when none is open.
  int current_connection() const;
  // Records to one connection by its number (Request::connection), whether or not it is the
  // current one. False when that connection has ended or the record could not be sent.
  bool respond_to(int connection, Header header, const std::vector<uint8_t>& body);
  bool indicate_to(int connection, Header header, const std::vector<uint8_t>& body);

  // Hook run for every WRITE before the healthy phone (if on) answers it; tests use it to answer
  // a request at the moment it arrives. Runs on the simulator's connection thread.
  // fault() must not be called from it (it would wait for an acknowledgement that only this
  // thread can read): there it returns false and sends nothing.
  using RequestHook = std::function<void(Simulator&, const Request&)>;
  void set_request_hook(RequestHook hook);

  // Hook run when a connection completes its OPEN handshake (opened true) and when an opened
  // connection ends (opened false), on the simulator's connection thread. Connections still open
  // when the simulator is destroyed end without it.
  using ConnectionHook = std::function<void(Simulator&, int connection, bool opened)>;
  void set_connection_hook(ConnectionHook hook);

 private:
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace kestrel_sim
