// The test driver: a real Connection (the same line reader, output queue,
// gates and close path as in the suite) over an in-memory transport, with a
// clock the test moves. Sessions are driven without sockets:
//
//   TestLink link(svc::smtp);               // the registered service's own rules and session
//   link.feed("HELO x\r\nNOOP\r\n", 3);     // in pieces of 3 bytes
//   EXPECT_EQ(link.take(), "250 ...\r\n250 OK\r\n");
//   link.advance(std::chrono::seconds(1));  // timers fire
//   EXPECT_EQ(link.reason(), CloseReason::requested);
//
// Connection::start_tls works here too, without any cryptography: once the
// bytes queued before it are out, the connection counts as secure() and the
// dialogue goes on in the clear, so a session's STARTTLS can be tested for
// what it answers, what it forgets and what pipelined input it drops.
// tls_plan() tells what the last upgrade asked for (a client's host and
// verification) and clear_output() what the peer received before it; after
// refuse_tls() an upgrade fails as a handshake would.
//
// After every piece of input the after-pass hooks run (as at the end of a
// pass of the loop), so work they carry (the mail queue's group commit)
// happens as in the suite. A session that yields its turn
// (Connection::yield_turn) is served again at the next pass: by default the
// driver runs those passes at once, until none is asked for; after
// hold_passes() the test runs them one at a time with pass(), and sees
// what other connections got in between.
#pragma once

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "core/connection.h"
#include "core/connection_core.h"

namespace velmor {

class TestLink final : public ConnectionHost {
 public:
  // A connection of the registered service `service` from `peer` (loopback
  // unless given): its accept rule, line rules, time-outs and session.
  explicit TestLink(int service, Peer peer = {});
  // A connection with a session of the test's own making.
  TestLink(std::unique_ptr<Session> session, std::size_t input_capacity = 4096, Peer peer = {});
  ~TestLink() override;
  TestLink(const TestLink&) = delete;
  TestLink& operator=(const TestLink&) = delete;

  // The peer sends `bytes`, in pieces of `piece` bytes (0: all at once);
  // the connection gets a turn after each piece.
  void feed(std::string_view bytes, std::size_t piece = 0);
  // The peer finishes sending (its end of data), or vanishes.
  void finish();
  void vanish();
  // What the peer received so far: all of it, or what came since the last take.
  const std::string& output() const { return to_peer_; }
  std::string take();
  // The peer reads at most this many more bytes (then the transport says
  // "would block"); unlimited by default.
  void peer_window(std::size_t bytes);
  // Moves the clock; timers that come due fire.
  void advance(std::chrono::milliseconds by);
  // One more turn (after something outside changed the connection).
  void turn();
  // Passes yielded turns wait for (see above); pass() runs one, false when
  // none was asked for.
  void hold_passes() { hold_passes_ = true; }
  bool pass();

  Connection& connection() { return *connection_; }
  bool closed() const { return connection_->closed(); }
  // How many writes the connection made (each one a segment on a socket).
  int writes() const { return writes_; }
  std::optional<CloseReason> reason() const { return reason_; }
  const std::optional<TlsPlan>& tls_plan() const { return tls_plan_; }
  std::string_view clear_output() const { return std::string_view(to_peer_).substr(0, clear_end_); }
  void refuse_tls() { refuse_tls_ = true; }

  // ConnectionHost
  void touch(Connection&) override { touched_ = true; }
  void timer_changed(Connection&, std::int64_t due) override { due_ = due; }
  void release(Connection& c) override;
  std::int64_t now_ms() const override { return now_ms_; }
  void next_pass(Connection&) override { yielded_ = true; }

 private:
  struct Memory final : Transport {
    explicit Memory(TestLink& l, bool encrypted = false) : link(l), tls(encrypted) {}
    TestLink& link;
    bool tls;
    Io read(char* to, std::size_t room, std::size_t& got) override;
    Io write(std::span<const std::string_view> parts, std::size_t& put) override;
    bool secure() const override { return tls; }
    bool can_upgrade(const TlsPlan&) const override { return !tls; }
    std::unique_ptr<Transport> upgrade(const TlsPlan& plan) override {
      link.tls_plan_ = plan;
      link.clear_end_ = std::min(link.clear_end_, link.to_peer_.size());
      return link.refuse_tls_ ? nullptr : std::make_unique<Memory>(link, true);
    }
  };
  void begin(Peer peer);
  void pump();
  void settle();

  std::unique_ptr<Connection> connection_;
  std::string from_peer_, to_peer_;
  std::size_t taken_ = 0;
  std::size_t window_ = std::numeric_limits<std::size_t>::max();
  bool eof_ = false, reset_ = false;
  int writes_ = 0;
  std::optional<CloseReason> reason_;
  std::optional<TlsPlan> tls_plan_;
  bool refuse_tls_ = false;
  std::size_t clear_end_ = std::numeric_limits<std::size_t>::max();
  bool touched_ = false;
  bool yielded_ = false, hold_passes_ = false;
  std::int64_t due_ = 0;
  std::int64_t now_ms_ = 1'000'000;
};

}  // namespace velmor
