// TLS: the server's certificate, the transport, the implicit-TLS services and
// the certificate `--init` makes. OpenSSL is linked here and nowhere else
// (velmorctl never sees it).
#include "core/tls.h"

#include <fcntl.h>
#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <openssl/x509v3.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"

namespace velmor {

namespace {

// Owners of OpenSSL's objects.
struct Free {
  void operator()(SSL_CTX* p) const { SSL_CTX_free(p); }
  void operator()(SSL* p) const { SSL_free(p); }
  void operator()(BIO* p) const { BIO_free_all(p); }
  void operator()(X509* p) const { X509_free(p); }
  void operator()(EVP_PKEY* p) const { EVP_PKEY_free(p); }
  void operator()(BIO_METHOD* p) const { BIO_meth_free(p); }
  void operator()(GENERAL_NAMES* p) const { GENERAL_NAMES_free(p); }
  void operator()(BIGNUM* p) const { BN_free(p); }
};
template <class T>
using Owned = std::unique_ptr<T, Free>;

constexpr std::size_t kMaxPemFile = 1 << 20;  // a certificate chain is a few kilobytes

// The last error OpenSSL queued, as text ("" when none); the queue is emptied.
std::string ssl_error_text() {
  unsigned long code = 0, last = 0;
  while ((code = ERR_get_error()) != 0) last = code;
  if (!last) return {};
  char text[256];
  ERR_error_string_n(last, text, sizeof text);
  return text;
}

// The contexts every new connection starts from. SSL objects hold a
// reference to theirs, so a reload never pulls one from under a connection.
struct Contexts {
  Owned<SSL_CTX> server;
  Owned<SSL_CTX> client;
  Owned<SSL_CTX> client_verify;
  Owned<BIO_METHOD> socket_method;
};
Contexts& contexts() {
  static Contexts c;
  return c;
}

void common_settings(SSL_CTX* ctx) {
  SSL_CTX_set_min_proto_version(ctx, TLS1_2_VERSION);
  // A peer cannot make the suite renegotiate (each costs a handshake's CPU),
  // and a peer that closes without a close_notify simply ends its data: every
  // protocol spoken here frames its own messages.
  SSL_CTX_set_options(ctx, SSL_OP_NO_RENEGOTIATION | SSL_OP_IGNORE_UNEXPECTED_EOF | SSL_OP_NO_COMPRESSION);
  // Record buffers go back while a connection is idle; a record cut off by a
  // full socket is finished from wherever the connection's queue now keeps it.
  SSL_CTX_set_mode(ctx, SSL_MODE_RELEASE_BUFFERS | SSL_MODE_ENABLE_PARTIAL_WRITE |
                            SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
}

// ---- the socket BIO ---------------------------------------------------------------------
// OpenSSL's own socket BIO writes with write(2), which raises SIGPIPE at a
// vanished peer; this one sends with MSG_NOSIGNAL, like the plain transport.

int bio_write(BIO* b, const char* data, int n) {
  BIO_clear_retry_flags(b);
  ssize_t sent = ::send(BIO_get_fd(b, nullptr), data, static_cast<std::size_t>(n), MSG_NOSIGNAL | MSG_DONTWAIT);
  if (sent < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) BIO_set_retry_write(b);
  return static_cast<int>(sent);
}

int bio_read(BIO* b, char* to, int n) {
  BIO_clear_retry_flags(b);
  ssize_t got = ::recv(BIO_get_fd(b, nullptr), to, static_cast<std::size_t>(n), MSG_DONTWAIT);
  if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR)) BIO_set_retry_read(b);
  return static_cast<int>(got);
}

long bio_ctrl(BIO* b, int cmd, long num, void* ptr) {
  switch (cmd) {
    case BIO_C_SET_FD:
      BIO_set_data(b, reinterpret_cast<void*>(static_cast<std::intptr_t>(*static_cast<int*>(ptr))));
      BIO_set_init(b, 1);
      return 1;
    case BIO_C_GET_FD: {
      int fd = static_cast<int>(reinterpret_cast<std::intptr_t>(BIO_get_data(b)));
      if (ptr) *static_cast<int*>(ptr) = fd;
      return fd;
    }
    case BIO_CTRL_FLUSH:
      return 1;
    default:
      return 0;
  }
}

BIO* socket_bio(int fd) {
  auto& c = contexts();
  if (!c.socket_method) {
    c.socket_method.reset(BIO_meth_new(BIO_get_new_index() | BIO_TYPE_SOURCE_SINK | BIO_TYPE_DESCRIPTOR,
                                       "velmor socket"));
    if (!c.socket_method) return nullptr;
    BIO_meth_set_write(c.socket_method.get(), bio_write);
    BIO_meth_set_read(c.socket_method.get(), bio_read);
    BIO_meth_set_ctrl(c.socket_method.get(), bio_ctrl);
  }
  BIO* b = BIO_new(c.socket_method.get());
  if (b) BIO_set_fd(b, fd, BIO_NOCLOSE);  // the transport owns the descriptor
  return b;
}

// ---- the transport -------------------------------------------------------------------------

class TlsTransport final : public Transport {
 public:
  TlsTransport(UniqueFd fd, Owned<SSL> ssl, TlsRole role)
      : fd_(std::move(fd)), ssl_(std::move(ssl)), hs_need_(role == TlsRole::server ? Need::read : Need::write) {}

  ~TlsTransport() override {
    // A close_notify when the socket takes it at once; no waiting for the
    // peer's. Never after a fatal error (OpenSSL forbids it).
    if (established_ && !fatal_) {
      ERR_clear_error();
      SSL_shutdown(ssl_.get());
      ERR_clear_error();
    }
  }

  Io advance() override {
    if (fatal_) return Io::failed;
    if (established_) return Io::ok;
    ERR_clear_error();
    int rc = SSL_do_handshake(ssl_.get());
    if (rc == 1) {
      established_ = true;
      hs_need_ = Need::none;
      return Io::ok;
    }
    switch (SSL_get_error(ssl_.get(), rc)) {
      case SSL_ERROR_WANT_READ:
        hs_need_ = Need::read;
        return Io::would_block;
      case SSL_ERROR_WANT_WRITE:
        hs_need_ = Need::write;
        return Io::would_block;
      case SSL_ERROR_SYSCALL:
        fail(errno ? std::strerror(errno) : "the peer closed the connection");
        return Io::failed;
      default:
        fail({});
        return Io::failed;
    }
  }

  Io read(char* to, std::size_t room, std::size_t& got) override {
    got = 0;
    if (fatal_) return Io::failed;
    if (!established_) return Io::would_block;  // advance() drives the handshake
    ERR_clear_error();
    std::size_t n = 0;
    int rc = SSL_read_ex(ssl_.get(), to, room, &n);
    read_needs_write_ = false;
    if (rc == 1) {
      got = n;
      return Io::ok;
    }
    switch (SSL_get_error(ssl_.get(), rc)) {
      case SSL_ERROR_WANT_READ:
        return Io::would_block;
      case SSL_ERROR_WANT_WRITE:
        read_needs_write_ = true;
        return Io::would_block;
      case SSL_ERROR_ZERO_RETURN:
        return Io::closed;  // the peer's close_notify, or its end of data
      case SSL_ERROR_SYSCALL:
        if (ERR_peek_error() == 0 && errno == 0) return Io::closed;
        fail(std::strerror(errno));
        return Io::failed;
      default:
        fail({});
        return Io::failed;
    }
  }

  Io write(std::span<const std::string_view> parts, std::size_t& put) override {
    put = 0;
    if (fatal_) return Io::failed;
    if (!established_) return Io::would_block;
    std::size_t total = 0;
    for (std::string_view part : parts) total += part.size();
    while (put < total) {
      std::string_view chunk = gather(parts, put);
      ERR_clear_error();
      std::size_t n = 0;
      int rc = SSL_write_ex(ssl_.get(), chunk.data(), chunk.size(), &n);
      write_needs_read_ = false;
      if (rc == 1) {
        put += n;
        continue;
      }
      switch (SSL_get_error(ssl_.get(), rc)) {
        case SSL_ERROR_WANT_WRITE:
          return put ? Io::ok : Io::would_block;
        case SSL_ERROR_WANT_READ:
          write_needs_read_ = true;
          return put ? Io::ok : Io::would_block;
        case SSL_ERROR_SYSCALL:
          fail(std::strerror(errno));
          return Io::failed;
        default:
          fail({});
          return Io::failed;
      }
    }
    return Io::ok;
  }

  bool secure() const override { return established_ && !fatal_; }

  Need needs() const override {
    if (fatal_) return Need::none;
    if (!established_) return hs_need_;
    if (write_needs_read_) return Need::read;
    if (read_needs_write_) return Need::write;
    return Need::none;
  }

  bool read_ready() const override {
    return established_ && !fatal_ && (read_needs_write_ || SSL_pending(ssl_.get()) > 0);
  }

  std::string failure() const override { return why_; }

 private:
  void fail(std::string why) {
    fatal_ = true;
    std::string lib = ssl_error_text();
    why_ = !lib.empty() ? lib : why.empty() ? std::string("protocol error") : std::move(why);
  }

  // The next record's bytes, from `skip` bytes into the parts: as much as a
  // record holds, copied together when they span parts. Parts written one
  // by one would each go out as a record and a segment of their own, and a
  // reply's short tail would wait for the peer's delayed acknowledgement.
  // A write cut off is retried with the same bytes first (maybe more), as
  // OpenSSL requires.
  std::string_view gather(std::span<const std::string_view> parts, std::size_t skip) {
    std::size_t i = 0;
    while (skip >= parts[i].size()) skip -= parts[i++].size();
    std::string_view first = parts[i].substr(skip);
    if (first.size() >= kRecordBytes || i + 1 == parts.size()) return first;
    stage_.assign(first);
    for (++i; i < parts.size() && stage_.size() < kRecordBytes; ++i)
      stage_.append(parts[i].substr(0, kRecordBytes - stage_.size()));
    return stage_;
  }

  static constexpr std::size_t kRecordBytes = 16384;
  UniqueFd fd_;
  Owned<SSL> ssl_;
  std::string stage_;  // a record's bytes gathered from several parts
  Need hs_need_;
  bool established_ = false;
  bool fatal_ = false;
  bool read_needs_write_ = false;  // a read must send first (a key update's answer)
  bool write_needs_read_ = false;  // a write must read first
  std::string why_;
};

// ---- the certificate ------------------------------------------------------------------

// The whole file, or why not. At most kMaxPemFile bytes.
bool read_pem_file(const std::string& path, std::string& text, std::string& why) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
  if (!fd) {
    why = strprintf("cannot open %s: %s", path.c_str(), std::strerror(errno));
    return false;
  }
  text.clear();
  char buf[8192];
  for (;;) {
    ssize_t n = ::read(fd.get(), buf, sizeof buf);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      why = strprintf("cannot read %s: %s", path.c_str(), std::strerror(errno));
      OPENSSL_cleanse(buf, sizeof buf);
      return false;
    }
    if (n == 0) break;
    text.append(buf, static_cast<std::size_t>(n));
    if (text.size() > kMaxPemFile) {
      why = strprintf("%s is larger than a certificate file can be", path.c_str());
      OPENSSL_cleanse(buf, sizeof buf);
      return false;
    }
  }
  OPENSSL_cleanse(buf, sizeof buf);
  return true;
}

// A text that holds a secret, wiped when it goes.
struct Secret {
  std::string text;
  ~Secret() { OPENSSL_cleanse(text.data(), text.size()); }
};

std::string describe(X509* cert) {
  char name[256] = "";
  X509_NAME_get_text_by_NID(X509_get_subject_name(cert), NID_commonName, name, sizeof name);
  std::string until;
  if (Owned<BIO> b{BIO_new(BIO_s_mem())}; b && ASN1_TIME_print(b.get(), X509_get0_notAfter(cert))) {
    char* data = nullptr;
    long n = BIO_get_mem_data(b.get(), &data);
    until.assign(data, static_cast<std::size_t>(n));
  }
  return strprintf("for %s, valid until %s", name[0] ? name : "(no common name)", until.c_str());
}

// A server context from the configured files, or why not.
Owned<SSL_CTX> server_context(std::string& why, std::string& what) {
  const std::string& cert_path = text_of(config.tls_cert);
  const std::string& key_path = text_of(config.tls_key);
  if (cert_path.empty() || key_path.empty()) {
    why = "tls.cert and tls.key are not both set";
    return nullptr;
  }
  std::string cert_text;
  Secret key_text;
  if (!read_pem_file(cert_path, cert_text, why) || !read_pem_file(key_path, key_text.text, why)) return nullptr;
  ERR_clear_error();
  Owned<SSL_CTX> ctx{SSL_CTX_new(TLS_server_method())};
  if (!ctx) {
    why = "no TLS context: " + ssl_error_text();
    return nullptr;
  }
  common_settings(ctx.get());
  SSL_CTX_set_options(ctx.get(), SSL_OP_CIPHER_SERVER_PREFERENCE);
  // Resumption costs the server a bounded cache; tickets cost it nothing.
  static const unsigned char kContext[] = "velmor";
  SSL_CTX_set_session_id_context(ctx.get(), kContext, sizeof kContext - 1);
  SSL_CTX_sess_set_cache_size(ctx.get(), 1024);
  SSL_CTX_set_num_tickets(ctx.get(), 1);

  Owned<BIO> certs{BIO_new_mem_buf(cert_text.data(), static_cast<int>(cert_text.size()))};
  Owned<X509> leaf{PEM_read_bio_X509_AUX(certs.get(), nullptr, nullptr, nullptr)};
  if (!leaf || SSL_CTX_use_certificate(ctx.get(), leaf.get()) != 1) {
    why = strprintf("no certificate in %s: %s", cert_path.c_str(), ssl_error_text().c_str());
    return nullptr;
  }
  while (X509* next = PEM_read_bio_X509(certs.get(), nullptr, nullptr, nullptr)) {
    if (SSL_CTX_add0_chain_cert(ctx.get(), next) != 1) {
      X509_free(next);
      why = strprintf("the chain in %s cannot be used: %s", cert_path.c_str(), ssl_error_text().c_str());
      return nullptr;
    }
  }
  ERR_clear_error();  // the end of the chain reads as "no start line"
  Owned<BIO> keys{BIO_new_mem_buf(key_text.text.data(), static_cast<int>(key_text.text.size()))};
  // A key under a passphrase is refused: asked for one, the library would
  // wait at the terminal, and the one thread with it.
  bool protected_key = false;
  auto no_passphrase = [](char*, int, int, void* asked) {
    *static_cast<bool*>(asked) = true;
    return -1;
  };
  Owned<EVP_PKEY> key{PEM_read_bio_PrivateKey(keys.get(), nullptr, no_passphrase, &protected_key)};
  if (protected_key) {
    ERR_clear_error();
    why = strprintf("the key in %s is protected by a passphrase; the suite needs it without one", key_path.c_str());
    return nullptr;
  }
  if (!key || SSL_CTX_use_PrivateKey(ctx.get(), key.get()) != 1) {
    why = strprintf("no private key in %s: %s", key_path.c_str(), ssl_error_text().c_str());
    return nullptr;
  }
  if (SSL_CTX_check_private_key(ctx.get()) != 1) {
    why = strprintf("the key in %s does not belong to the certificate in %s", key_path.c_str(), cert_path.c_str());
    return nullptr;
  }
  what = cert_path + " " + describe(leaf.get());
  return ctx;
}

SSL_CTX* client_context(TlsVerify verify) {
  auto& c = contexts();
  Owned<SSL_CTX>& slot = verify == TlsVerify::peer ? c.client_verify : c.client;
  if (!slot) {
    slot.reset(SSL_CTX_new(TLS_client_method()));
    if (!slot) return nullptr;
    common_settings(slot.get());
    if (verify == TlsVerify::peer) {
      SSL_CTX_set_default_verify_paths(slot.get());
      SSL_CTX_set_verify(slot.get(), SSL_VERIFY_PEER, nullptr);
    }
  }
  return slot.get();
}

std::time_t last_failure_logged = 0;
int failures_unlogged = 0;

}  // namespace

TlsLoad tls_load() {
  auto& c = contexts();
  std::string why, what;
  Owned<SSL_CTX> fresh = server_context(why, what);
  if (fresh) {
    c.server = std::move(fresh);
    log_message("TLS certificate loaded: ", what);
    return TlsLoad::loaded;
  }
  std::string line = "TLS certificate not loaded: " + why;
  if (c.server) {
    line += "; the one loaded before stays in use";
    log_message(line);
    log_write(line, logchan::errors);
    return TlsLoad::kept;
  }
  line += "; TLS is off, the plain services run without it";
  log_message(line);
  log_write(line, logchan::errors);
  return TlsLoad::off;
}

bool tls_available() { return contexts().server != nullptr; }

void tls_reset() {
  auto& c = contexts();
  c.server.reset();
  c.client.reset();
  c.client_verify.reset();
  last_failure_logged = 0;
  failures_unlogged = 0;
}

std::unique_ptr<Transport> tls_transport(UniqueFd fd, const TlsPlan& plan) {
  if (!fd) return nullptr;
  SSL_CTX* ctx = plan.role == TlsRole::server ? contexts().server.get() : client_context(plan.verify);
  if (!ctx) return nullptr;
  ERR_clear_error();
  Owned<SSL> ssl{SSL_new(ctx)};
  BIO* bio = ssl ? socket_bio(fd.get()) : nullptr;
  if (!bio) {
    ERR_clear_error();
    return nullptr;
  }
  SSL_set_bio(ssl.get(), bio, bio);  // the SSL owns the BIO
  // Records are already whole writes; Nagle would only hold a reply's record
  // back behind the handshake's last (the session tickets) until the peer's
  // delayed acknowledgement. (A socket that is not TCP says no; no matter.)
  int on = 1;
  ::setsockopt(fd.get(), IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
  if (plan.role == TlsRole::server) {
    SSL_set_accept_state(ssl.get());
  } else {
    if (!plan.host.empty()) {
      SSL_set_tlsext_host_name(ssl.get(), plan.host.c_str());
      if (plan.verify == TlsVerify::peer) SSL_set1_host(ssl.get(), plan.host.c_str());
    }
    SSL_set_connect_state(ssl.get());
  }
  return std::make_unique<TlsTransport>(std::move(fd), std::move(ssl), plan.role);
}

void tls_note_failure(std::string_view peer, int service, std::string_view why) {
  if (last_failure_logged == server_now) {
    ++failures_unlogged;
    return;
  }
  std::string line = strprintf("TLS handshake with %.*s (service %d) failed: %.*s", static_cast<int>(peer.size()),
                               peer.data(), service, static_cast<int>(why.size()), why.data());
  if (failures_unlogged) line += strprintf(" (and %d more since the last line)", failures_unlogged);
  last_failure_logged = server_now;
  failures_unlogged = 0;
  log_message(line);
}

// ---- services ------------------------------------------------------------------------

void tls_register_services() {
  struct Twin {
    int base, number;
    const char* name;
    bool* enabled;
    std::int32_t *port, *max, *timeout;
    bool implicit_tls;
  };
  const Twin twins[] = {
      {svc::smtp, svc::smtps, "smtps", &config.smtps_sock_enabled, &config.smtps_sock_port, &config.smtps_sock_max,
       &config.smtps_sock_timeout, true},
      {svc::smtp, svc::submission, "submission", &config.submission_sock_enabled, &config.submission_sock_port,
       &config.submission_sock_max, &config.submission_sock_timeout, false},
      {svc::pop, svc::pops, "pops", &config.pops_sock_enabled, &config.pops_sock_port, &config.pops_sock_max,
       &config.pops_sock_timeout, true},
      {svc::imap, svc::imaps, "imaps", &config.imaps_sock_enabled, &config.imaps_sock_port, &config.imaps_sock_max,
       &config.imaps_sock_timeout, true},
  };
  for (const Twin& t : twins) {
    const ServiceDescriptor* base = service_find(t.base);
    if (!base) continue;  // that protocol is not served (yet)
    ServiceDescriptor twin = *base;
    twin.number = t.number;
    twin.name = t.name;
    twin.enabled = t.enabled;
    twin.port = t.port;
    twin.max = t.max;
    twin.timeout = t.timeout;
    twin.implicit_tls = t.implicit_tls;
    twin.plain = t.base;
    service_register(std::move(twin));
  }
}

// ---- --init ----------------------------------------------------------------------------

std::string tls_make_self_signed(const std::string& cert_path, const std::string& key_path, std::string_view host,
                                 int uid, int gid) {
  ERR_clear_error();
  auto failed = [](const char* step) { return strprintf("%s failed: %s", step, ssl_error_text().c_str()); };
  Owned<EVP_PKEY> key{EVP_EC_gen("P-256")};
  if (!key) return failed("making the key");
  Owned<X509> cert{X509_new()};
  if (!cert || X509_set_version(cert.get(), 2) != 1) return failed("making the certificate");
  Owned<BIGNUM> serial{BN_new()};
  if (!serial || BN_rand(serial.get(), 63, BN_RAND_TOP_ANY, BN_RAND_BOTTOM_ANY) != 1 ||
      !BN_to_ASN1_INTEGER(serial.get(), X509_get_serialNumber(cert.get())))
    return failed("the serial number");
  // Valid from an hour ago (clocks differ) for 825 days, the most some
  // clients accept for a server certificate.
  X509_gmtime_adj(X509_getm_notBefore(cert.get()), -3600);
  X509_gmtime_adj(X509_getm_notAfter(cert.get()), 825L * 24 * 3600);
  X509_NAME* name = X509_get_subject_name(cert.get());
  std::string common(host.substr(0, 64));  // a common name holds at most 64 characters
  if (common.empty()) common = "localhost";
  if (X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_UTF8, reinterpret_cast<const unsigned char*>(common.c_str()),
                                 -1, -1, 0) != 1 ||
      X509_set_issuer_name(cert.get(), name) != 1 || X509_set_pubkey(cert.get(), key.get()) != 1)
    return failed("naming the certificate");
  // The host as a DNS name, built as a structure: a name with a "," in it
  // stays one name.
  Owned<GENERAL_NAMES> names{GENERAL_NAMES_new()};
  for (std::string_view dns : {std::string_view(common), std::string_view("localhost")}) {
    if (dns == "localhost" && common == "localhost" && sk_GENERAL_NAME_num(names.get()) > 0) break;
    GENERAL_NAME* gn = GENERAL_NAME_new();
    ASN1_IA5STRING* text = ASN1_IA5STRING_new();
    if (!gn || !text || ASN1_STRING_set(text, dns.data(), static_cast<int>(dns.size())) != 1) {
      GENERAL_NAME_free(gn);
      ASN1_IA5STRING_free(text);
      return failed("the certificate's names");
    }
    GENERAL_NAME_set0_value(gn, GEN_DNS, text);
    sk_GENERAL_NAME_push(names.get(), gn);
  }
  if (X509_add1_ext_i2d(cert.get(), NID_subject_alt_name, names.get(), 0, X509V3_ADD_DEFAULT) != 1)
    return failed("the certificate's names");
  X509V3_CTX ext{};
  X509V3_set_ctx(&ext, cert.get(), cert.get(), nullptr, nullptr, 0);
  for (auto [nid, value] : {std::pair{NID_basic_constraints, "critical,CA:FALSE"},
                            std::pair{NID_key_usage, "critical,digitalSignature"},
                            std::pair{NID_ext_key_usage, "serverAuth"},
                            std::pair{NID_subject_key_identifier, "hash"}}) {
    X509_EXTENSION* e = X509V3_EXT_conf_nid(nullptr, &ext, nid, value);
    if (!e) return failed("the certificate's extensions");
    int added = X509_add_ext(cert.get(), e, -1);
    X509_EXTENSION_free(e);
    if (added != 1) return failed("the certificate's extensions");
  }
  if (X509_sign(cert.get(), key.get(), EVP_sha256()) <= 0) return failed("signing the certificate");

  auto pem = [](auto write) {
    Owned<BIO> b{BIO_new(BIO_s_mem())};
    std::string out;
    if (b && write(b.get())) {
      char* data = nullptr;
      long n = BIO_get_mem_data(b.get(), &data);
      out.assign(data, static_cast<std::size_t>(n));
      OPENSSL_cleanse(data, static_cast<std::size_t>(n));
    }
    return out;
  };
  Secret key_pem{pem([&](BIO* b) {
    return PEM_write_bio_PrivateKey(b, key.get(), nullptr, nullptr, 0, nullptr, nullptr) == 1;
  })};
  std::string cert_pem = pem([&](BIO* b) { return PEM_write_bio_X509(b, cert.get()) == 1; });
  if (key_pem.text.empty() || cert_pem.empty()) return failed("writing the certificate");
  make_parent_dirs(key_path);
  make_parent_dirs(cert_path);
  if (int error = file_write_atomic(key_path, key_pem.text, false, 0600))
    return strprintf("cannot write %s: %s", key_path.c_str(), std::strerror(error));
  if (int error = file_write_atomic(cert_path, cert_pem, false, 0644))
    return strprintf("cannot write %s: %s", cert_path.c_str(), std::strerror(error));
  if (uid != -1 || gid != -1) {
    for (const std::string* path : {&key_path, &cert_path}) {
      if (::lchown(path->c_str(), static_cast<uid_t>(uid), static_cast<gid_t>(gid)) != 0)
        return strprintf("cannot hand %s over: %s", path->c_str(), std::strerror(errno));
    }
  }
  return {};
}

}  // namespace velmor
