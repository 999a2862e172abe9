// TLS for the connection layer: a Transport that encrypts a connection, the
// server's certificate and the contexts behind it, the implicit-TLS
// listeners, and the self-signed certificate `--init` makes.
//
// Sessions never include this: a session asks Connection::secure() and
// upgrades with Connection::start_tls() / start_tls_client() (core/connection.h);
// services that speak TLS from the first byte set
// ServiceDescriptor::implicit_tls (core/network.h).
//
// Every handshake step, read and write is non-blocking and driven by the
// loop; a connection holds one SSL object and at most OpenSSL's two record
// buffers, freed while idle; nothing is buffered without bound.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include "core/connection.h"
#include "core/fileio.h"

namespace velmor {

// ---- the certificate ---------------------------------------------------------------

enum class TlsLoad {
  loaded,  // tls.cert and tls.key are in use for new connections
  kept,    // the new ones could not be used; the ones before stay in use
  off,     // no certificate: implicit-TLS listeners close what they accept,
           // STARTTLS is not offered; the plain services run as ever
};
// Reads tls.cert (PEM: the certificate, then its chain) and tls.key (PEM)
// into a fresh server context for new connections; connections under way
// keep theirs. Logs one line saying what happened and why. Start-up and
// "reload config" call it.
TlsLoad tls_load();
// A certificate is loaded: implicit TLS works and STARTTLS may be offered.
bool tls_available();
// Drops the contexts (tests; shutdown).
void tls_reset();

// ---- the transport ------------------------------------------------------------------

// TLS over a connected, non-blocking socket (owned), as `plan` says. nullptr
// when it cannot be made (the server role with no certificate loaded).
std::unique_ptr<Transport> tls_transport(UniqueFd fd, const TlsPlan& plan);
// One line in the main log for a failed handshake, at most one a second
// however many fail (a flood of garbage costs no more log than one client).
void tls_note_failure(std::string_view peer, int service, std::string_view why);

// ---- services ------------------------------------------------------------------------

// The implicit-TLS twins of the registered plain services (SMTP on
// smtps.sock.*, POP3 on pops.sock.*, IMAP on imaps.sock.*) and the
// submission listener (submission.sock.*, plain, for STARTTLS). A twin takes
// its plain service's accept rule and sessions; one whose plain service is
// not registered is left out, so call this after the services' own
// registrations.
void tls_register_services();

// ---- --init -------------------------------------------------------------------------

// Makes a self-signed certificate for `host` (an EC P-256 key, SHA-256,
// valid 825 days, the host as common name and DNS name) with the library
// itself: the key to `key_path` (mode 0600), the certificate to `cert_path`;
// both owned by `uid`/`gid` when those are not -1. "" = done; otherwise why not.
std::string tls_make_self_signed(const std::string& cert_path, const std::string& key_path, std::string_view host,
                                 int uid = -1, int gid = -1);

}  // namespace velmor
