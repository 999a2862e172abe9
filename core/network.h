// Services and the event loop. A service describes itself once (its keys,
// its accept rule, how to make a session) and the loop does the rest:
// listeners, accepting, reading, writing, time-outs, outward connections
// and their host lookups. The loop knows no protocol; what a connection
// means lives in the service's Session (core/connection.h). A whole
// service in thirty lines: "Writing a protocol" in docs/ARCHITECTURE.md.
//
// The loop also serves raw descriptors (datagram sockets: the control
// channel, the resolver) with "call this when readable", and runs the
// per-pass and per-tick hooks that carry work such as the mail queue's group
// commit.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "core/config.h"
#include "core/connection.h"

namespace velmor {

// Service numbers (status displays and logs know services by them).
namespace svc {
inline constexpr int imap = 10;
inline constexpr int imaps = 11;       // IMAP with TLS from the first byte
inline constexpr int smtp = 20;
inline constexpr int smtp_client = 21;
inline constexpr int smtps = 22;       // SMTP submission with TLS from the first byte
inline constexpr int submission = 23;  // SMTP submission, STARTTLS before AUTH
inline constexpr int pop = 30;
inline constexpr int pop_client = 31;
inline constexpr int pops = 32;        // POP3 with TLS from the first byte
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

// The accept rule's verdict on a peer: one test for every service. A peer in
// `allow` is accepted with no further test; otherwise one in `block` is
// refused; otherwise one in `auth` must identify itself; anyone else is
// accepted.
enum class Admission { accepted, identify, refused };

struct ServiceDescriptor {
  int number = 0;
  std::string name{};  // "smtp", for logs
  // The service's own keys (pointers into `config`); null = none. A service
  // without a port key has no listener (outward connections only).
  const bool* enabled = nullptr;
  const std::int32_t* port = nullptr;
  const std::int32_t* max = nullptr;      // connections at once (listener backlog beyond)
  const std::int32_t* timeout = nullptr;  // idle seconds before a close (0 = none)
  // The accept rule.
  const AddressList* allow = nullptr;
  const AddressList* block = nullptr;
  const AddressList* auth = nullptr;
  // What a refused peer is told before its connection closes ("" = nothing).
  std::function<std::string()> refusal{};
  // The session of a new connection (accepted, or made by connect_to).
  std::function<std::unique_ptr<Session>(Connection&, Admission)> make_session{};
  // Input rules.
  std::size_t line_limit = 0;  // 0 = the input buffer's size
  LineEnds line_ends = LineEnds::lf;
  // The idle clock restarts at a complete line (command protocols), or at
  // any byte received (relays).
  bool paced_by_lines = true;
  // TLS from the first byte: the handshake runs before the session hears
  // anything; with no certificate loaded, what is accepted is closed at once.
  bool implicit_tls = false;
  // Another listener of the plain service of this number (its sessions and
  // accept rule): a session tells submission from SMTP by its service number.
  int plain = 0;
};
// Adds (or replaces) a service. Its listener opens at net_start.
void service_register(ServiceDescriptor service);
const ServiceDescriptor* service_find(int number);
// Every registered service, in the order of registration.
std::vector<const ServiceDescriptor*> service_list();
Admission service_admit(const ServiceDescriptor& service, std::uint32_t peer_nbo);

// ---- start-up and shutdown ----------------------------------------------------

// What net_start did with one registered service that has a port key.
struct ListenReport {
  std::string service;  // its name
  std::string address;  // the address listened on ("0.0.0.0": every address)
  int port = 0;         // the port asked for
  bool enabled = true;  // false: switched off in the configuration, nothing opened
  std::string error;    // why the port could not be taken ("" = listening)
};
// Opens a listener for every registered, enabled service with a port key,
// in the order they were registered; a port that cannot be taken does not
// stop the others from being tried, so every failure is named. 0 = every
// listener is open; 1 = at least one failed (logged). `report`, when given,
// gets one entry per service with a port key.
int net_start(std::vector<ListenReport>* report = nullptr);
// Opens a listener of `service` on `port` of paths.bind_address (every
// address when empty); port 0 takes an ephemeral one. The port bound; -1
// when it failed (logged, and the reason put in `error` when given).
int net_listen(int service, int port, std::string* error = nullptr);
// Closes every connection (their sessions hear CloseReason::shutdown),
// listener and watched descriptor.
void net_close_all();
// For tests: net_close_all, then forgets every service, hook and resolver.
void net_reset();

// ---- the loop -------------------------------------------------------------------

// One pass: waits up to `timeout_ms` (earlier when a timer is due) for
// readiness, serves every connection that is ready, then runs the
// after-pass hooks and sends what they queued.
void net_pass(int timeout_ms);
// Once per tick (half a second): idle and session time-outs, then the
// every-tick hooks.
void net_tick();
// Work done once per pass, after every connection was served (batched
// syncs before replies go out), and once per tick.
void after_pass(std::function<void()> hook);
void every_tick(std::function<void()> hook);
// Runs the after-pass hooks now (the loop does, at the end of every pass;
// so does the test driver after each piece of input).
void run_after_pass();

// "Call this when this descriptor is readable" for datagram and other raw
// descriptors the caller owns. false when it cannot be watched.
bool watch_readable(int fd, std::function<void()> ready);
// "Call this once when this descriptor can be written" (a datagram socket
// whose reader's queue was full): the wait ends with the call; ask again to
// wait again. The descriptor may also be watched for reading. false when it
// cannot be watched.
bool watch_writable(int fd, std::function<void()> ready);
// Stops watching a raw descriptor, for reading and writing.
void unwatch(int fd);

// ---- connections -----------------------------------------------------------------

// The open connection with this id; nullptr once it has closed.
Connection* connection_find(std::uint64_t id);
// Connections of `service` now (accepted and outward, not listeners).
int connection_count(int service);
std::size_t connection_total();
std::uint64_t accepted_total();

// An outward connection of `service` to `host` (a name or a dotted quad) and
// `port`: phase lookup while the name resolver works, connecting, then open
// with on_open. A failure reaches on_close with lookup_failed or
// connect_failed. Closing it while it waits cancels its lookup at once.
Connection* connect_to(int service, std::string_view host, std::uint16_t port, std::unique_ptr<Session> session);

// How outward connections find addresses (the resolver fills this at start).
// `start` calls `done` once with the address (network order; 0 = failed),
// possibly before it returns, and gives a handle (0 when it ended at once);
// `cancel` drops a lookup still running.
// `mail_exchangers` looks up a domain's mail hosts the same way.
enum class MxResult {
  found,           // `hosts` holds them, lowest preference first
  none,            // the domain exists and has no mail exchanger
  no_such_domain,  // the name does not exist
  failed,          // no usable answer (time-out, link down, no resolver)
};
struct MxAnswer {
  MxResult result = MxResult::failed;
  std::vector<std::string> hosts{};
};
struct NameResolver {
  std::function<std::uint64_t(std::string_view name, std::function<void(std::uint32_t)> done)> start{};
  std::function<void(std::uint64_t handle)> cancel{};
  std::function<std::uint64_t(std::string_view domain, std::function<void(MxAnswer)> done)> mail_exchangers{};
};
void net_set_resolver(NameResolver resolver);
// A domain's mail exchangers through the resolver: `done` is called once,
// possibly before this returns (then 0 is returned), else the handle of
// the lookup, which net_cancel_lookup drops without calling `done`.
std::uint64_t net_lookup_mail_exchangers(std::string_view domain, std::function<void(MxAnswer)> done);
void net_cancel_lookup(std::uint64_t handle);

}  // namespace velmor
