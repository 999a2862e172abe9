// The core's side of a Connection: what the event loop (core/network.cpp)
// and the test driver (core/test_link.h) do with one. Sessions never include
// this.
#pragma once

#include <cstdint>
#include <memory>

#include "core/connection.h"

namespace velmor {

struct ServiceDescriptor;

// What a connection needs from whoever drives it.
class ConnectionHost {
 public:
  virtual ~ConnectionHost() = default;
  // Output was queued, or a gate opened, outside the connection's own turn:
  // serve it before the pass ends.
  virtual void touch(Connection& c) = 0;
  // The connection's wake-up time changed (0 = none).
  virtual void timer_changed(Connection& c, std::int64_t due_ms) = 0;
  // The connection has closed and its session has been told: forget it
  // (the object itself lives until the pass ends).
  virtual void release(Connection& c) = 0;
  virtual std::int64_t now_ms() const = 0;
  // The session yielded its turn (Connection::yield_turn): call
  // ConnectionCore::resume_turn and serve it at the start of the next pass.
  virtual void next_pass(Connection& c) = 0;
};

struct ConnectionCore {
  static std::unique_ptr<Connection> make(ConnectionHost& host, std::uint64_t id, int service,
                                          std::size_t input_capacity);
  static void set_phase(Connection& c, Phase phase) { c.phase_ = phase; }
  static void set_peer(Connection& c, Peer peer) { c.peer_ = std::move(peer); }
  static void set_transport(Connection& c, std::unique_ptr<Transport> t, int fd) {
    c.transport_ = std::move(t);
    c.fd_ = fd;
  }
  static Transport* transport(Connection& c) { return c.transport_.get(); }
  static int fd(const Connection& c) { return c.fd_; }
  static void set_session(Connection& c, std::unique_ptr<Session> s) { c.session_ = std::move(s); }
  static void set_paced_by_lines(Connection& c, bool paced) { c.paced_by_lines_ = paced; }
  static std::uint64_t lookup(const Connection& c) { return c.lookup_; }
  static void set_lookup(Connection& c, std::uint64_t id) { c.lookup_ = id; }
  static std::uint16_t target_port(const Connection& c) { return c.target_port_; }
  static void set_target_port(Connection& c, std::uint16_t port) { c.target_port_ = port; }
  static std::int64_t wake_due(const Connection& c) { return c.wake_due_ms_; }
  static CloseReason close_reason(const Connection& c) { return c.close_reason_; }

  // Phase open from now on: on_open, then the first serve.
  static void open(Connection& c);
  // One turn: send what is queued, read when `readable`, offer the input to
  // the session, send again, and close a connection that is done.
  static void serve(Connection& c, bool readable);
  // The next pass came for a connection that yielded: its input is offered again.
  static void resume_turn(Connection& c);
  // The wake-up time came: on_timer, then a turn without reading.
  static void fire_timer(Connection& c);
  // What the connection waits for now.
  static bool wants_read(const Connection& c);
  static bool wants_write(const Connection& c);
};

// Settles a new accepted connection of `service` (also for the test driver):
// the service's line rules and time-outs, the accept rule (a refused peer
// is told so and closed), the session, and on_open.
void start_accepted(Connection& c, const ServiceDescriptor& service);

}  // namespace velmor
