// The SMTP client (service 21): sends the outgoing queue while the link is
// up. One connection per route at a time: "default" goes to the relay host
// (`smtp.hosts`), a domain of `smtp.direct` to its mail exchangers, lowest
// preference first (to the domain's own address only when it has none).
// A connection takes ("holds") each queue entry it sends until it ends, so
// overlapping runs never send a message twice. A message leaves the queue
// only after the server's 2xx to its final dot, or when it was refused for
// good and has gone back to its sender; a temporary refusal keeps it.
//
// TLS: a server that lists STARTTLS in its EHLO reply gets it, and EHLO is
// said again under TLS. Without credentials the encryption is opportunistic
// (the certificate is not checked), and a failed handshake is followed by one
// new plain connection to the same host, so mail keeps flowing to a server
// whose TLS is broken. A relay given with credentials is logged in to (AUTH
// PLAIN, else LOGIN) only under TLS with a certificate that verifies against
// the system's trusted roots: otherwise no password is sent, one line in the
// mail log says why, and the mail stays queued for a later run.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

class ByteSource;
class Session;

// The relay host: the first entry of smtp.hosts, "[user:password@]host[:port]"
// (entries end at a blank or a comma). The host follows the last '@' and the
// user ends at the first ':' before it, so a password may hold ':' and '@'.
struct SmtpRelay {
  std::string user, password, host;
  std::uint16_t port = 25;
  bool login() const { return !user.empty(); }
};
enum class RelayParse { ok, none, bad };
RelayParse smtp_relay_parse(std::string_view text, SmtpRelay& relay);

// Registers service 21, the "smtpkick" hook and the client count.
void smtp_client_register();
// Starts a connection for every route with mail no connection holds (a run
// started by the poll leaves alone a route that failed a moment ago). True
// when a connection was started; false too when the link is down.
bool smtp_send_run(bool by_poll = false);
// The mail poll's step: a run every `smtp.time` minutes (-1: every poll).
void smtp_client_poll();
// Routes being served (looking up, connecting or connected) and TURN sessions.
int smtp_client_count();
// The client role on a connection a peer opened and handed us by TURN: it
// waits for the peer's greeting and sends the "default" route's mail.
std::unique_ptr<Session> smtp_turn_session();
// The session of the default route's connection to `relay`, outside any run
// (tests drive it over a TestLink).
std::unique_ptr<Session> smtp_client_session(const SmtpRelay& relay);
// Where the lines holding only "." start in bytes [from, to) of a stored
// message (each goes out with another "." in front, so no file can end its
// message early). `whole` is false when the source could not be read.
std::vector<std::uint64_t> lone_dot_lines(ByteSource& in, std::uint64_t from, std::uint64_t to, bool& whole);
// For tests: forgets every route.
void smtp_client_reset();

}  // namespace velmor
