// Socket records and the event dispatcher. Every socket of the suite,
// listening or connected, stream or datagram, belongs to one SocketRecord,
// found by its descriptor. The dispatcher waits for readiness (epoll) and
// hands each event to the handlers that the record's service registered:
// accept on listening records, read and write on connected ones, connect
// completion, and the end of a host lookup. What a connection means lives in
// the service's own folder; it plugs in with register_service().
#pragma once

#include <netinet/in.h>

#include <cstdint>
#include <ctime>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "core/config.h"
#include "core/filecache.h"

namespace velmor {

struct GroupOptions;  // users/groups.h

// Service numbers.
namespace svc {
inline constexpr int imap = 10;
inline constexpr int smtp = 20;
inline constexpr int smtp_client = 21;
inline constexpr int pop = 30;
inline constexpr int pop_client = 31;
inline constexpr int nntp = 40;
inline constexpr int news_client = 41;
inline constexpr int web = 50;
inline constexpr int web_internal = 51;
inline constexpr int proxy_server = 60;
inline constexpr int proxy = 61;
inline constexpr int telnet_server = 70;
inline constexpr int telnet = 71;
inline constexpr int multiport_server = 80;
inline constexpr int multiport = 81;
inline constexpr int ssl_server = 90;
inline constexpr int ssl_client = 91;
inline constexpr int socks_server = 94;
inline constexpr int socks = 95;
inline constexpr int raudio_server = 97;
inline constexpr int raudio = 98;
inline constexpr int dns = 100;
inline constexpr int cache_request = 110;
inline constexpr int ftp_server = 130;
inline constexpr int ftp = 131;
inline constexpr int ftp_data = 132;
inline constexpr int icp = 400;
inline constexpr int proxy_datagram = 410;
inline constexpr int control = 500;
}  // namespace svc
inline constexpr int kDatagram = 0x100000;  // added to `service` of datagram and local records

// Common states; any other value belongs to the service.
namespace sockstate {
inline constexpr int listening = 0;
inline constexpr int connecting = 10;
inline constexpr int connected = 20;
inline constexpr int initial = 30;
inline constexpr int lookup = 80;
inline constexpr int closing = 999;  // send what is pending, then close
}  // namespace sockstate

// A fixed-capacity byte buffer. The capacity is set when the record is made
// and never changes, so a later "reload config" cannot overrun older records.
// A NUL always fits behind the data.
class IoBuffer {
 public:
  IoBuffer() = default;
  explicit IoBuffer(std::size_t capacity);
  std::size_t capacity() const { return capacity_; }
  std::size_t size() const { return len_; }
  std::size_t room() const { return capacity_ - len_; }
  bool empty() const { return len_ == 0; }
  char* data() { return buf_.get(); }
  const char* data() const { return buf_.get(); }
  std::string_view view() const { return {buf_.get(), len_}; }
  // Appends all of `text`, or nothing (returning false) when it does not fit.
  bool append(std::string_view text);
  void consume(std::size_t n);  // drops n bytes from the front
  void clear();
  char* tail() { return buf_.get() + len_; }  // for receiving into
  void commit(std::size_t n);                 // n bytes were written at tail()

 private:
  std::unique_ptr<char[]> buf_;
  std::size_t capacity_ = 0;
  std::size_t len_ = 0;
};

// Per-service connection state; each service derives its own.
struct SessionData {
  virtual ~SessionData() = default;
};

struct SocketRecord {
  int fd = -1;
  // Never reused: tells this connection from every other, also from a later
  // one on the same descriptor (owner of marks such as a mailbox's in-use).
  std::uint64_t id = 0;
  int service = 0;
  int state = 0;
  std::uint32_t flags = 0;
  IoBuffer read_buf;
  IoBuffer write_buf;
  // The idle time-out runs from here: the last send, or the last receive
  // that completed a line for the command protocols (SMTP, POP3, IMAP, NNTP,
  // web), so a client that trickles bytes cannot hold its slot.
  std::time_t last_active = 0;
  std::time_t created = 0;
  std::string peer_addr;       // dotted form, set on accept
  std::uint32_t peer_ip = 0;   // network byte order
  std::string user_name;       // authenticated user, empty when none
  std::shared_ptr<const GroupOptions> group_opts;  // the default group when made
  sockaddr_in target{};        // where an outward connection goes
  CacheFile file;              // files held by the connection; both are
  CacheFile send_file;         // closed when the record closes
  // Set while the service has something to stream beyond write_buf, so the
  // dispatcher asks for write readiness even with an empty write_buf.
  bool want_write = false;
  std::string url;
  int partner = -1;
  std::uint64_t bytes_sent = 0;
  std::uint64_t bytes_received = 0;
  std::unique_ptr<SessionData> session;

  template <class T>
  T& session_as() { return static_cast<T&>(*session); }
  bool closed = false;  // released; the record is freed after the dispatcher pass

  // Kept by the dispatcher; services leave these alone.
  struct Dispatch {
    bool watched = false;          // registered with epoll
    std::uint32_t events = 0;      // the readiness interest registered
    std::uint32_t generation = 0;  // tells a reused descriptor from its predecessor
    int counted_service = 0;       // the counter this record raised (0 = none)
    bool accepted = false;         // made by accept: sock.session.max applies
    bool peer_counted = false;     // counted in its peer's share (record_set_peer)
    std::int64_t timer_due = 0;    // socket_timer: monotonic ms, 0 = none
    bool peer_eof = false;         // the peer finished sending: no more reads
    bool lookup_ended = false;     // record_lookup_complete() was called ...
    bool lookup_ok = false;        // ... with this result
    std::time_t accept_paused_until = 0;  // listeners: out of descriptors
  } dispatch;
};

// What a service plugs in. Handlers return 0 to keep the connection and
// non-zero to have it closed; they may also close it themselves. A handler
// that throws has its connection closed (datagram and listening sockets
// stay) and one line written to the error log; the suite goes on.
struct ServiceHandlers {
  // A new connection of this service was accepted (peer_addr is set).
  std::function<int(SocketRecord&)> accept{};
  // n > 0 bytes were just received into read_buf (already counted in its
  // size). Datagram records are called with n == 0 and receive themselves.
  std::function<int(SocketRecord&, long n)> read{};
  // The socket was writable: the dispatcher has already sent what it took of
  // write_buf. Called while output is pending or want_write is set, and once
  // more when write_buf has just drained, so a service that paused for room
  // (or streams a file) continues here.
  std::function<int(SocketRecord&)> write{};
  // The peer closed (n == 0) or a receive failed (n == -1). Unset: close.
  std::function<int(SocketRecord&, long n)> peer_closed{};
  std::function<void(SocketRecord&)> connect_failed{};
  std::function<void(SocketRecord&)> connect_done{};  // state 10 -> 20
  std::function<void(SocketRecord&)> lookup_failed{};
  std::function<void(SocketRecord&)> lookup_done{};
  // The per-service release when the record closes (files, locks, counts).
  std::function<void(SocketRecord&)> release{};
  // The time set with socket_timer() has come. Non-zero: close.
  std::function<int(SocketRecord&)> timer{};
  // Seconds of inactivity after which the record is closed (0 = never).
  // Unset: the service's sock.timeout key (120 s for the HTTP proxy).
  std::function<int()> idle_timeout{};
  // The record was idle too long. Unset: socket_close.
  std::function<void(SocketRecord&)> timed_out{};
  // Simultaneous connections allowed. Unset: the service's sock.max key.
  std::function<int()> max_connections{};
  // Seconds an accepted connection may last in all (0 = no limit). Unset:
  // sock.session.max.
  std::function<int()> session_limit{};
  // Set by services that open their own sockets (several listeners, datagram
  // sockets): listeners_open calls it in the service's place in the order
  // instead of opening the standard listener. 0 = done.
  std::function<int()> open_sockets{};
};
void register_service(int service, ServiceHandlers handlers);
const ServiceHandlers* service_handlers(int service);

// Sets up the table, raises the descriptor limit, completes admin.email and
// opens every listener of a registered, enabled service, then the control
// channel. 0 = done; non-zero = a listener failed.
int sockets_init();
int listeners_open();
// Opens one listener (protocol 6 TCP, 17 UDP) on paths.bind_address (every
// address when empty). A TCP port of 0 takes an ephemeral port; a UDP port of
// 0 stays unbound. 0; 1 socket or bind failure; -1 option failure.
int listener_open(int port, int service, int protocol, int* descriptor_out = nullptr);
// Accepting on a service: the run-time switch tested at every accept (set
// from the sock.enabled keys by sockets_init).
void service_switch(int service, bool on);

// One pass: wait up to `timeout_ms` for readiness and deliver every event.
void dispatcher(int timeout_ms);
// Closes every connected record idle for longer than its service's time-out,
// and every accepted one older than its session limit; run once per tick.
void sockets_check_timeouts();
// Calls the service's `timer` handler once `ms` milliseconds have passed,
// without holding up anything else (a later call replaces the time; 0
// cancels). The dispatcher's wait ends in time for it.
void socket_timer(SocketRecord& record, int ms);

SocketRecord* record_for(int fd);
// Makes the record for a descriptor (with I/O buffers unless a datagram or
// listener) and watches the descriptor. Every record other than listeners and
// datagram records counts as a connection of `service`. nullptr on failure.
SocketRecord* record_create(int fd, int service, int state);
// The resolver's end of a host lookup for a record in state 80: the
// dispatcher calls the service's lookup_done or lookup_failed on its next pass.
void record_lookup_complete(SocketRecord& record, bool ok);
// Sets the peer of an accepted record and counts the record in the peer's
// share of its service (see peer_may_connect).
void record_set_peer(SocketRecord& record, std::uint32_t peer_nbo);
// One peer address may hold at most a quarter of a service's connection
// slots (at least one); loopback peers are not limited. True when `peer`
// may open one more connection of `service`; accept closes it otherwise.
bool peer_may_connect(int service, std::uint32_t peer_nbo);
// Sends from the front of write_buf; the unsent rest stays at its front.
// Returns bytes sent (0 when the socket is full) or -1 on a real error.
long socket_send(SocketRecord& record);
// Sends raw bytes directly (bypassing write_buf); same results.
long socket_send(SocketRecord& record, std::string_view data);
// Releases the record (service release, counts, files) and closes the
// descriptor. Safe to call from inside the record's own handlers.
void socket_close(int fd);
int record_close(int fd);
void sockets_close_all();

// Outward connections: a non-blocking TCP socket connecting to `address`;
// the caller makes the record in state 10. -1 on failure.
int socket_connect(const sockaddr_in& address);
int socket_datagram();
// Every descriptor of the suite is non-blocking and close-on-exec.
int socket_options(int fd);

// Connection counters for the status displays and limits: the records of
// `service` open now (never below 0).
int connection_count(int service);
std::uint64_t accepted_total();
std::uint64_t service_bytes_received(int service);
// Number of records (of every kind) in the table.
std::size_t record_count();

// The common use of a service's peer address lists at accept: a peer in
// `allow` is accepted with no further test; otherwise one in `block` is
// refused; otherwise one in `auth` must identify itself.
enum class PeerRule { allowed, blocked, must_auth, ordinary };
PeerRule peer_rule(std::uint32_t peer_nbo, const AddressList& allow, const AddressList& block,
                   const AddressList* auth = nullptr);

// Strips telnet option negotiation from the front of read_buf, answering it
// into write_buf. 1 when data remains.
int telnet_filter(SocketRecord& record);

// Dotted text of a network-order address.
std::string dotted(std::uint32_t address_nbo);

}  // namespace velmor
