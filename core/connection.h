// One connection layer under every protocol. The core owns the Connection:
// its descriptor behind a Transport, the input buffer and its line reader,
// the output queue of byte chunks and file ranges, its phase, its timers and
// its partner. A protocol owns one Session per connection and keeps its own
// state inside it; it reads lines or bytes from the Connection and queues its
// replies there, and never touches a descriptor, the event loop or another
// connection's fields. A service describes itself to the loop in
// core/network.h; "Writing a protocol" in docs/ARCHITECTURE.md shows a whole
// one in thirty lines.
//
// The rules the core keeps for every session:
// - on_input runs only while input is not paused and the output is below the
//   high-water mark; read_line() says need_more as soon as either stops, so
//   "while there is a line, run the command" never overruns anything. Once
//   the output drains below the low-water mark (or input is resumed) the
//   session is offered its input again, in the same pass.
// - Every way out goes through one close path: on_close runs exactly once,
//   with the reason, after the callback that asked for the close returns.
//   close_after_send() sends what is queued first; a peer that vanished is
//   closed at once; a peer that only finished sending gets its last complete
//   lines served and its replies sent before the close.
// - No exception leaves a session callback: the core catches it, writes one
//   line to the error log and closes that connection (CloseReason::failed).
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <ctime>
#include <deque>
#include <memory>
#include <span>
#include <string>
#include <string_view>

#include "core/fileio.h"

namespace velmor {

struct GroupOptions;  // users/groups.h; the core only carries it
class Connection;
class ConnectionHost;
struct ConnectionCore;

// Only the core moves a connection from phase to phase.
enum class Phase {
  listening,   // a listener: accepts, never reads
  lookup,      // an outward connection waiting for its host's address
  connecting,  // an outward connection whose connect is in progress
  open,        // accepted, or connected: input and output flow
  closing,     // sending what is queued, then closing; no more input
};

// Why a connection ended (told to Session::on_close).
enum class CloseReason {
  requested,       // the session (or a partner's) asked for it
  peer_closed,     // the peer finished sending; what it asked for was sent
  peer_reset,      // the peer vanished (reset, broken pipe): closed at once
  timed_out,       // idle longer than its time-out
  session_limit,   // open longer than its service allows in all
  connect_failed,  // an outward connect was refused or failed
  lookup_failed,   // an outward connection's host has no address
  shutdown,        // the suite is stopping
  failed,          // a session callback threw, or the core could not go on
  tls_failed,      // the TLS handshake failed (garbage, no common ground, an
                   // unverified peer), or TLS is off where it was required
};
const char* close_reason_text(CloseReason reason);

enum class LineResult {
  line,       // `line` holds the next line, without its line end
  need_more,  // no whole line yet, or input is held back (paused, output full)
  overlong,   // a line longer than the limit: reported once, the rest of it
              // is discarded as it arrives, whatever the buffer size
};

// What ends a line. CR LF and a bare LF always do; `cr_too` also takes a
// bare CR (its LF, when it follows, even in a later read, belongs to it).
enum class LineEnds { lf, cr_too };

struct Peer {
  std::uint32_t ip = 0;  // network byte order; 0 for a peer with no IPv4 address
  std::uint16_t port = 0;
  std::string text{};    // dotted form, for logs and replies
  bool loopback() const;
};
// Dotted text of a network-order address.
std::string dotted(std::uint32_t address_nbo);

// Who speaks first in a TLS handshake, and how a client checks the server.
enum class TlsRole { server, client };
enum class TlsVerify {
  none,  // encrypt without asking who answers (opportunistic STARTTLS)
  peer,  // the certificate must chain to the system's trusted roots and name the host
};
// What a connection upgraded to TLS (Connection::start_tls).
struct TlsPlan {
  TlsRole role = TlsRole::server;
  std::string host{};  // client: the server's name (SNI, and checked with TlsVerify::peer)
  TlsVerify verify = TlsVerify::none;
};

// How bytes leave and arrive: a plain socket, or TLS over it (core/tls.h).
// A transport that must exchange bytes of its own before data can move (a
// handshake, or a record cut off mid-way) says so through needs(), and the
// core drives it with advance() at every turn; sessions never see any of it.
class Transport {
 public:
  enum class Io { ok, would_block, closed, failed };
  // What the transport waits for before its data can move.
  enum class Need { none, read, write };
  virtual ~Transport() = default;
  // Reads up to `room` bytes. ok with `got` > 0; closed at the peer's end of
  // data; failed when the connection broke.
  virtual Io read(char* to, std::size_t room, std::size_t& got) = 0;
  // Writes from the parts in order; `put` is how many bytes went. After
  // would_block the next call starts with the same bytes (maybe more of them,
  // maybe at another address), as a TLS record cut off mid-way needs.
  virtual Io write(std::span<const std::string_view> parts, std::size_t& put) = 0;
  // Encrypted, with the handshake done.
  virtual bool secure() const { return false; }
  // One step of the transport's own work: ok = data may flow; would_block =
  // waiting for needs(); failed = it cannot go on (the connection closes).
  virtual Io advance() { return Io::ok; }
  virtual Need needs() const { return Need::none; }
  // Bytes may be read without the descriptor becoming readable (decrypted
  // bytes held inside the transport).
  virtual bool read_ready() const { return false; }
  // Why the last failure happened, for the log ("" = not known).
  virtual std::string failure() const { return {}; }
  // Whether upgrade() can work now (TLS is on, for the server role).
  virtual bool can_upgrade(const TlsPlan&) const { return false; }
  // The same connection under TLS; this transport hands its descriptor over
  // and is dropped. nullptr when it cannot.
  virtual std::unique_ptr<Transport> upgrade(const TlsPlan&) { return nullptr; }
};

// The plain transport over a connected, non-blocking socket (owned).
class PlainTransport final : public Transport {
 public:
  explicit PlainTransport(UniqueFd fd) : fd_(std::move(fd)) {}
  Io read(char* to, std::size_t room, std::size_t& got) override;
  Io write(std::span<const std::string_view> parts, std::size_t& put) override;
  bool can_upgrade(const TlsPlan& plan) const override;
  std::unique_ptr<Transport> upgrade(const TlsPlan& plan) override;
  int fd() const { return fd_.get(); }

 private:
  UniqueFd fd_;
};

// Bytes `offset` to `offset + length` of an open file, queued for output. The
// descriptor is shared, so the session may close its own handle (or the file
// may be renamed over) while the range is still being sent.
struct FileRange {
  enum class Transform {
    none,
    dot_stuff,    // a line that starts with "." gets another one in front
    dot_unstuff,  // a line that starts with "." loses it (transmission form to plain)
    // Text already in transmission form whose line of a lone "." would end
    // it early (a damaged file): that line alone gets another dot.
    stuff_lone_dots,
  };
  std::shared_ptr<const UniqueFd> file{};
  std::uint64_t offset = 0;
  std::uint64_t length = 0;
  Transform transform = Transform::none;  // the range starts at a line start
  // Sent in place of the rest when the file cannot be read; the connection
  // then closes, since the peer could not tell a cut copy from a whole one.
  std::string failure_text{};
};

class Session {
 public:
  virtual ~Session() = default;
  // Accepted, or an outward connect completed: greet, or send the first line.
  virtual void on_open(Connection&) {}
  // Input arrived (or may be served again): read lines or bytes until
  // read_line says need_more, or until the session waits for something.
  virtual void on_input(Connection&) = 0;
  // The output fell below the low-water mark after reaching the high-water
  // mark: a session producing a long listing queues the next part here.
  virtual void on_drained(Connection&) {}
  // The time asked for with wake_after() has come.
  virtual void on_timer(Connection&) {}
  // The connection is ending, for `reason`; called once, whatever the way
  // out. Let go of everything held for it here (marks, files, waiters).
  virtual void on_close(Connection&, CloseReason) {}
};

class Connection {
 public:
  // Output above this stops input; below the low-water mark input resumes.
  static constexpr std::size_t kHighWater = 64 * 1024;
  static constexpr std::size_t kLowWater = 16 * 1024;

  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;
  ~Connection();

  // Never reused within a run: marks a connection holds (a mailbox's in-use
  // mark, a waiting reply) are keyed by it, never by a descriptor.
  std::uint64_t id() const { return id_; }
  int service() const { return service_; }
  Phase phase() const { return phase_; }
  const Peer& peer() const { return peer_; }
  // Encrypted, with the handshake done.
  bool secure() const;
  bool closed() const { return closed_; }

  // ---- TLS in place (STARTTLS, STLS) -----------------------------------------
  enum class TlsStart {
    started,      // the upgrade is under way
    unavailable,  // TLS is off (no certificate loaded): answer as for no TLS
    already,      // secure already, or an upgrade is under way
  };
  // Upgrades this connection to TLS as the server: what the session queued
  // before the call (its "ready" reply) is sent in the clear, then the
  // handshake runs, then everything queued after the call goes encrypted.
  // Input the peer sent before the handshake (bytes behind the command in
  // the same packet, anything sent while the reply went out) is discarded,
  // never read as a command of the encrypted session; the session is offered
  // no input until the handshake has finished, and should forget what the
  // clear-text part of the dialogue told it. A failed handshake closes the
  // connection with CloseReason::tls_failed.
  TlsStart start_tls();
  // The same as the client of `plan.host` (after the server's "ready" reply
  // was read; a reply's unread rest is discarded the same way).
  TlsStart start_tls_client(std::string host, TlsVerify verify);

  // ---- input ---------------------------------------------------------------
  // The next line, without its line end; the view stays valid until the
  // session returns. A complete line refreshes the idle clock of a service
  // paced by lines.
  LineResult read_line(std::string_view& line);
  // Everything received and not yet consumed (exact byte counts: literals,
  // message bodies, relays); consume() drops bytes from its front.
  std::string_view buffered();
  void consume(std::size_t n);
  // The input buffer is full: nothing more arrives until the session consumes.
  bool input_full() const;
  // Longest line (without its line end); 0 = the input buffer's size.
  void set_line_limit(std::size_t limit) { line_limit_ = limit; }
  void set_line_ends(LineEnds ends) { line_ends_ = ends; }
  // The peer has finished sending: what is buffered is all there will be.
  bool peer_finished() const { return peer_eof_; }
  // While paused the session is not offered input (e.g. waiting for a disk
  // commit or a delayed reply); resume offers what is buffered again.
  void pause_input();
  void resume_input();
  bool input_paused() const { return paused_; }
  // The session has used its share of this pass (a client pipelining
  // hundreds of commands) and stops with input left: on_input is offered
  // again at the loop's next pass, after the other connections had their
  // turn, whether or not more input arrives meanwhile. Until then it is not
  // offered input, and a peer that finished sending is not closed on.
  void yield_turn();
  bool yielded() const { return yielded_; }

  // ---- output --------------------------------------------------------------
  // Queues bytes; the core sends them in order with the queued file ranges.
  // Ignored once the connection is closing or closed.
  void send(std::string_view bytes);
  void send_file(FileRange range);
  // Bytes queued and not yet sent (file ranges by their remaining length).
  std::size_t pending() const { return pending_; }
  // At or over the high-water mark: a session producing a long answer stops
  // here and goes on in on_drained, which comes below the low-water mark.
  bool output_full() const { return pending_ >= kHighWater; }
  // Phase closing: input stops, the queue is sent, then the connection closes.
  void close_after_send();
  // Closes at once (what is queued is dropped); on_close is told `reason`.
  void close_now(CloseReason reason = CloseReason::requested);

  // ---- time ----------------------------------------------------------------
  // on_timer after `delay`, without holding anything up; a later call
  // replaces the time, zero cancels.
  void wake_after(std::chrono::milliseconds delay);
  // Seconds without a complete line (or a send) before the connection is
  // closed; 0 = never. Set from the service's time-out key at the start.
  void set_idle_timeout(int seconds) { idle_timeout_ = seconds; }
  int idle_timeout() const { return idle_timeout_; }
  // Seconds an accepted connection may last in all; 0 = no limit.
  void set_session_limit(int seconds) { session_limit_ = seconds; }
  int session_limit() const { return session_limit_; }
  std::time_t created() const { return created_; }
  std::time_t last_active() const { return last_active_; }

  // ---- who (settled by the session; the core carries them for logs) ---------
  void set_user(std::string user) { user_ = std::move(user); }
  const std::string& user() const { return user_; }
  void set_group(std::shared_ptr<const GroupOptions> group) { group_ = std::move(group); }
  const std::shared_ptr<const GroupOptions>& group() const { return group_; }

  // ---- relays ---------------------------------------------------------------
  // Pairs two connections: reading from either pauses while the other's
  // output is over the high-water mark. A close unlinks both.
  void link(Connection& partner);
  void unlink();
  Connection* partner() const { return partner_; }

  // ---- the session ----------------------------------------------------------
  Session* session() const { return session_.get(); }
  // The session as its own type; nullptr when it is another kind.
  template <class T>
  T* session_as() const {
    return dynamic_cast<T*>(session_.get());
  }

  std::uint64_t bytes_received() const { return bytes_in_; }
  std::uint64_t bytes_sent() const { return bytes_out_; }

 private:
  friend struct ConnectionCore;
  Connection(ConnectionHost& host, std::uint64_t id, int service, std::size_t capacity);

  struct OutItem {
    std::string bytes;      // a byte chunk (consecutive sends join one chunk) ...
    FileRange file;         // ... or a file range
    bool is_file = false;
    bool upgrade = false;   // ... or the point where TLS starts (tls_plan_)
    std::size_t done = 0;   // of `bytes`, or of `stage`
    std::string stage;      // the file's next bytes, transformed
    bool line_start = true; // the transform's position
    bool dot_ahead = false; // stuff_lone_dots: the stage ended in a line's first "."
  };

  bool gate_open() const;
  TlsStart begin_tls(TlsPlan plan);
  bool upgrade_transport();
  void advance();
  std::string_view data() const { return {in_.get() + in_start_, in_end_ - in_start_}; }
  void drop_input(std::size_t n);
  void swallow_lf();
  void note_line();
  bool fill_stage(OutItem& item);
  static void stuff_lone_dots(OutItem& item, std::string_view raw);
  void flush();
  void read_some();
  void deliver();
  void settle();
  void finish(CloseReason reason);
  void note_fullness();
  template <class F>
  void call(const char* step, F&& f);

  ConnectionHost& host_;
  std::uint64_t id_;
  int service_;
  Phase phase_ = Phase::open;
  Peer peer_;
  int fd_ = -1;  // the descriptor the loop watches (the transport uses it)
  std::unique_ptr<Transport> transport_;
  std::unique_ptr<Session> session_;

  // Input: bytes [in_start_, in_end_) of a buffer of `capacity_` bytes,
  // made at the first read.
  std::unique_ptr<char[]> in_;
  std::size_t in_start_ = 0, in_end_ = 0;
  std::size_t capacity_;
  std::size_t line_limit_ = 0;
  LineEnds line_ends_ = LineEnds::lf;
  bool skipping_ = false;    // discarding the rest of an overlong line
  bool lf_pending_ = false;  // a bare CR ended the last line: its LF may follow
  bool peer_eof_ = false;
  bool paused_ = false;
  bool dirty_ = false;       // something changed since on_input last ran
  bool gated_ = false;       // on_input stopped because input was held back
  bool paced_by_lines_ = true;
  bool yielded_ = false;     // yield_turn(): on_input again at the next pass

  // TLS in place: queued = the upgrade waits in the output queue (nothing is
  // read meanwhile); handshaking = the new transport works on it.
  enum class TlsStep { none, queued, handshaking };
  TlsStep tls_step_ = TlsStep::none;
  std::unique_ptr<TlsPlan> tls_plan_;

  // Output.
  std::deque<OutItem> out_;
  std::size_t pending_ = 0;
  bool was_full_ = false;

  // Closing.
  bool closed_ = false;
  bool close_pending_ = false;
  CloseReason close_reason_ = CloseReason::requested;
  CloseReason after_send_reason_ = CloseReason::requested;
  int in_callback_ = 0;

  // Time.
  std::int64_t wake_due_ms_ = 0;
  int idle_timeout_ = 0;
  int session_limit_ = 0;
  std::time_t created_ = 0;
  std::time_t last_active_ = 0;

  std::string user_;
  std::shared_ptr<const GroupOptions> group_;
  Connection* partner_ = nullptr;
  std::uint64_t bytes_in_ = 0, bytes_out_ = 0;
  std::uint64_t lookup_ = 0;  // the pending host lookup (phase lookup)
  std::uint16_t target_port_ = 0;
};

}  // namespace velmor
