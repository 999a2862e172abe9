// TLS: the transport over a socket pair, driven by hand both ways; then
// connections of the loop over loopback (TLS from the first byte, an upgrade
// in place, garbage and stalled handshakes); then the certificate files.
#include "core/tls.h"

#include <gtest/gtest.h>
#include <fcntl.h>
#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <vector>

#include "core/log.h"
#include "core/network.h"
#include "core/test_files.h"
#include "core/test_fixture.h"
#include "core/test_link.h"

namespace velmor {
namespace {

using testing_files::read_file;
using testing_files::ScratchDir;
using testing_files::write_file;
using Io = Transport::Io;
using Need = Transport::Need;
using Clock = std::chrono::steady_clock;

class TlsTest : public SuiteTest {
 protected:
  void SetUp() override {
    SuiteTest::SetUp();
    cert = (dir.path() / "cert.pem").string();
    key = (dir.path() / "key.pem").string();
    ASSERT_EQ(tls_make_self_signed(cert, key, "mail.example.test"), "");
    config.tls_cert = cert;
    config.tls_key = key;
    ASSERT_EQ(tls_load(), TlsLoad::loaded);
  }
  ScratchDir dir;
  std::string cert, key;
};

// Both ends of a socket pair, non-blocking, with small socket buffers so
// that writes are cut off.
struct Pair {
  int fd[2] = {-1, -1};
  Pair() {
    EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0, fd), 0);
    int small = 4096;
    for (int f : fd) setsockopt(f, SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
  }
};

TlsPlan client_plan(TlsVerify verify = TlsVerify::none) { return {TlsRole::client, "mail.example.test", verify}; }

// Steps both handshakes until neither waits; the results.
std::pair<Io, Io> handshake(Transport& server, Transport& client, int& waits) {
  Io s = Io::would_block, c = Io::would_block;
  for (int i = 0; i < 100 && (s == Io::would_block || c == Io::would_block); ++i) {
    c = client.advance();
    s = server.advance();
    waits += (s == Io::would_block) + (c == Io::would_block);
  }
  return {s, c};
}

TEST_F(TlsTest, TheTransportShakesHandsWithoutBlockingAndFinishesCutOffRecords) {
  Pair p;
  auto server = tls_transport(UniqueFd(p.fd[0]), TlsPlan{});
  auto client = tls_transport(UniqueFd(p.fd[1]), client_plan());
  ASSERT_TRUE(server && client);
  EXPECT_EQ(server->needs(), Need::read);  // the server waits for the hello
  EXPECT_EQ(client->needs(), Need::write);
  std::size_t n = 0;
  char buf[4096];
  EXPECT_EQ(server->read(buf, sizeof buf, n), Io::would_block);  // no data before the handshake
  int waits = 0;
  EXPECT_EQ(handshake(*server, *client, waits), std::make_pair(Io::ok, Io::ok));
  EXPECT_GT(waits, 0);
  EXPECT_TRUE(server->secure() && client->secure());

  // A megabyte through a 4 KB socket: every cut-off write is retried from a
  // buffer at a new address, as the connection's queue may hand it over.
  std::string payload;
  for (int i = 0; payload.size() < (1 << 20); ++i) payload += "line " + std::to_string(i) + "\r\n";
  std::string received;
  std::size_t sent = 0;
  int partial = 0;
  for (int round = 0; round < 100000 && received.size() < payload.size(); ++round) {
    if (sent < payload.size()) {
      std::string moved = payload.substr(sent);
      std::string_view part(moved);
      std::size_t put = 0;
      Io io = server->write(std::span(&part, 1), put);
      ASSERT_NE(io, Io::failed) << server->failure();
      partial += put < moved.size();
      sent += put;
    }
    Io io = client->read(buf, sizeof buf, n);
    ASSERT_NE(io, Io::failed) << client->failure();
    if (io == Io::ok) received.append(buf, n);
  }
  EXPECT_GT(partial, 0);
  EXPECT_EQ(received, payload);

  // The other way, parts in one record (a read returns at most one), then
  // the client's close_notify reads as the end of data.
  std::string_view hello[] = {"hel", "lo", "\r\n"};
  std::size_t put = 0;
  EXPECT_EQ(client->write(hello, put), Io::ok);
  EXPECT_EQ(put, 7u);
  EXPECT_EQ(server->read(buf, sizeof buf, n), Io::ok);
  EXPECT_EQ(std::string_view(buf, n), "hello\r\n");
  client.reset();
  EXPECT_EQ(server->read(buf, sizeof buf, n), Io::closed);
}

TEST_F(TlsTest, AClientThatVerifiesRefusesAnUnknownCertificateAndGarbageFailsTheServer) {
  {
    Pair p;
    auto server = tls_transport(UniqueFd(p.fd[0]), TlsPlan{});
    auto client = tls_transport(UniqueFd(p.fd[1]), client_plan(TlsVerify::peer));
    int waits = 0;
    auto [s, c] = handshake(*server, *client, waits);
    EXPECT_EQ(c, Io::failed);
    EXPECT_NE(client->failure().find("certificate"), std::string::npos) << client->failure();
    EXPECT_FALSE(client->secure());
  }
  Pair p;
  auto server = tls_transport(UniqueFd(p.fd[0]), TlsPlan{});
  ASSERT_EQ(::send(p.fd[1], "EHLO there\r\n", 12, 0), 12);
  EXPECT_EQ(server->advance(), Io::failed);
  EXPECT_FALSE(server->failure().empty());
  EXPECT_EQ(server->needs(), Need::none);  // nothing more to wait for: it closes
  ::close(p.fd[1]);
}

// ---- connections of the loop ------------------------------------------------------------

// Added to the clock while pumping, so a test can move past a time-out.
std::time_t clock_ahead = 0;

template <class Pred>
bool pump(Pred done, int ms = 5000) {
  auto end = Clock::now() + std::chrono::milliseconds(ms);
  while (!done()) {
    if (Clock::now() > end) return false;
    server_now = std::time(nullptr) + clock_ahead;
    net_pass(5);
  }
  return true;
}

int connect_local(int port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<std::uint16_t>(port));
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) ADD_FAILURE() << "no connect";
  return fd;
}

// A client: plain bytes first when it likes, then TLS over the same socket.
struct Client {
  int fd;
  std::unique_ptr<Transport> tls;
  std::string got, out;
  bool closed = false, failed = false;
  explicit Client(int port) : fd(connect_local(port)) {}
  ~Client() {
    if (!tls && fd >= 0) ::close(fd);
  }
  void start_tls() {
    ::fcntl(fd, F_SETFL, O_NONBLOCK);
    tls = tls_transport(UniqueFd(fd), client_plan());
  }
  void send(std::string_view text) {
    if (!tls) {
      ASSERT_EQ(::send(fd, text.data(), text.size(), 0), static_cast<ssize_t>(text.size()));
      return;
    }
    out += text;
  }
  // One step of everything the client does.
  void step() {
    char buf[65536];
    if (!tls) {
      ssize_t n = ::recv(fd, buf, sizeof buf, MSG_DONTWAIT);
      if (n > 0) got.append(buf, static_cast<std::size_t>(n));
      if (n == 0) closed = true;
      return;
    }
    if (tls->advance() == Io::failed) failed = true;
    if (!out.empty()) {
      std::string_view part(out);
      std::size_t put = 0;
      if (tls->write(std::span(&part, 1), put) == Io::failed) failed = true;
      out.erase(0, put);
    }
    std::size_t n = 0;
    Io io;
    while ((io = tls->read(buf, sizeof buf, n)) == Io::ok) got.append(buf, n);
    if (io == Io::closed) closed = true;
    if (io == Io::failed) failed = true;
  }
  bool wait_for(std::string_view text) {
    return pump([&] {
      step();
      return got.find(text) != std::string::npos || failed;
    }) && !failed;
  }
  bool wait_end() {
    return pump([&] {
      step();
      return closed || failed;
    });
  }
};

// Greets; answers each line with "<line> secure|clear"; "STARTTLS" answers
// "ready" and upgrades.
class Lines : public Session {
 public:
  std::vector<std::string>& lines;
  std::vector<CloseReason>& closes;
  Lines(std::vector<std::string>& l, std::vector<CloseReason>& c) : lines(l), closes(c) {}
  void on_open(Connection& c) override { c.send("hello\r\n"); }
  void on_input(Connection& c) override {
    std::string_view line;
    while (c.read_line(line) == LineResult::line) {
      lines.emplace_back(line);
      if (line == "STARTTLS") {
        c.send("ready\r\n");
        EXPECT_EQ(c.start_tls(), Connection::TlsStart::started);
        EXPECT_EQ(c.start_tls(), Connection::TlsStart::already);
        continue;  // read_line says need_more until the handshake is done
      }
      c.send(std::string(line) + (c.secure() ? " secure\r\n" : " clear\r\n"));
    }
  }
  void on_close(Connection&, CloseReason r) override { closes.push_back(r); }
};

class TlsLoopTest : public TlsTest {
 protected:
  void SetUp() override {
    TlsTest::SetUp();
    paths.bind_address = "127.0.0.1";
    config.sock_buffer = 1024;
    for (auto [number, tls_first] : {std::pair{svc::pop, false}, std::pair{svc::pops, true}}) {
      service_register({.number = number,
                        .name = tls_first ? "lines-tls" : "lines",
                        .port = &port_key,
                        .timeout = &timeout,
                        .make_session = [this](Connection&, Admission) {
                          return std::make_unique<Lines>(lines, closes);
                        },
                        .implicit_tls = tls_first});
    }
    plain = net_listen(svc::pop, 0);
    implicit = net_listen(svc::pops, 0);
    ASSERT_GT(plain, 0);
    ASSERT_GT(implicit, 0);
  }
  void TearDown() override {
    net_close_all();
    TlsTest::TearDown();
  }
  std::int32_t port_key = 0, timeout = 5;
  int plain = 0, implicit = 0;
  std::vector<std::string> lines;
  std::vector<CloseReason> closes;
};

TEST_F(TlsLoopTest, TlsFromTheFirstByteGreetsAfterTheHandshakeAndHeldBytesAreRead) {
  Client c(implicit);
  c.start_tls();
  ASSERT_TRUE(c.wait_for("hello\r\n"));
  // Far more than the 1 KB input buffer in one record: what the transport
  // holds decrypted is read as the session makes room, with no readiness.
  std::string many;
  for (int i = 0; i < 300; ++i) many += "line " + std::to_string(i) + "\r\n";
  c.send(many);
  ASSERT_TRUE(c.wait_for("line 299 secure\r\n"));
  EXPECT_EQ(lines.size(), 300u);
  EXPECT_EQ(c.got.find("clear"), std::string::npos);
}

TEST_F(TlsLoopTest, StartTlsDropsWhatCameBehindTheCommandAndGoesOnEncrypted) {
  Client c(plain);
  ASSERT_TRUE(c.wait_for("hello\r\n"));
  c.send("NOOP\r\nSTARTTLS\r\nRCPT TO:<injected@example.test>\r\n");  // one packet
  ASSERT_TRUE(c.wait_for("ready\r\n"));
  c.start_tls();
  c.send("AFTER\r\n");
  ASSERT_TRUE(c.wait_for("AFTER secure\r\n"));
  EXPECT_EQ(lines, (std::vector<std::string>{"NOOP", "STARTTLS", "AFTER"}));
  EXPECT_EQ(c.got.find("injected"), std::string::npos);
}

TEST_F(TlsLoopTest, GarbageFailsAtOnceAStalledHandshakeTimesOutAndOthersAreServedMeanwhile) {
  Client stalled(implicit);  // connects and says nothing
  Client garbage(implicit);
  garbage.send("EHLO nothing to see\r\n");
  ASSERT_TRUE(garbage.wait_end());
  EXPECT_TRUE(garbage.got.empty());
  ASSERT_TRUE(pump([&] { return closes.size() == 1; }));
  EXPECT_EQ(closes[0], CloseReason::tls_failed);

  Client fine(implicit);
  fine.start_tls();
  ASSERT_TRUE(fine.wait_for("hello\r\n"));
  fine.send("x\r\n");
  ASSERT_TRUE(fine.wait_for("x secure\r\n"));
  EXPECT_EQ(connection_count(svc::pops), 2);

  // The stalled one goes at its idle time-out; the busy one stays.
  clock_ahead = timeout + 1;
  fine.send("y\r\n");
  ASSERT_TRUE(fine.wait_for("y secure\r\n"));
  net_tick();
  clock_ahead = 0;
  ASSERT_TRUE(stalled.wait_end());
  EXPECT_EQ(connection_count(svc::pops), 1);
  EXPECT_EQ(closes.back(), CloseReason::timed_out);
}

TEST_F(TlsLoopTest, WithTlsOffTheImplicitListenerClosesWhatItAcceptsAndStartTlsIsRefused) {
  tls_reset();
  EXPECT_FALSE(tls_available());
  Client c(implicit);
  ASSERT_TRUE(c.wait_end());
  EXPECT_TRUE(c.got.empty());
  EXPECT_TRUE(closes.empty());  // no session was ever made

  Pair p;
  PlainTransport t{UniqueFd(p.fd[0])};
  EXPECT_FALSE(t.can_upgrade(TlsPlan{}));
  EXPECT_TRUE(t.can_upgrade(client_plan()));  // a client needs no certificate
  ::close(p.fd[1]);
}

// ---- the test driver's stand-in ---------------------------------------------------------

TEST_F(TlsTest, TheTestDriverUpgradesWithoutCryptographyAndDropsPipelinedInput) {
  std::vector<std::string> lines;
  std::vector<CloseReason> closes;
  TestLink link(std::make_unique<Lines>(lines, closes));
  EXPECT_FALSE(link.connection().secure());
  link.feed("STARTTLS\r\nMAIL FROM:<a@b>\r\n");
  EXPECT_EQ(link.take(), "hello\r\nready\r\n");
  EXPECT_TRUE(link.connection().secure());
  link.feed("NOOP\r\n", 2);
  EXPECT_EQ(link.take(), "NOOP secure\r\n");
  EXPECT_EQ(lines, (std::vector<std::string>{"STARTTLS", "NOOP"}));
}

// ---- the certificate files ------------------------------------------------------------

TEST_F(TlsTest, CertificatesLoadRenewAndAMissingOrWrongPairLeavesTlsOffOrAsItWas) {
  struct stat st {};
  ASSERT_EQ(::stat(key.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_NE(read_file(cert).find("BEGIN CERTIFICATE"), std::string::npos);

  // A chain: the server's certificate, then another.
  std::string other_cert = (dir.path() / "other.pem").string(), other_key = (dir.path() / "other.key").string();
  ASSERT_EQ(tls_make_self_signed(other_cert, other_key, "ca.example.test"), "");
  write_file(dir.path() / "chain.pem", read_file(cert) + read_file(other_cert));
  config.tls_cert = (dir.path() / "chain.pem").string();
  EXPECT_EQ(tls_load(), TlsLoad::loaded);

  // A key of another certificate, a missing file: the pair loaded before stays.
  config.tls_key = other_key;
  EXPECT_EQ(tls_load(), TlsLoad::kept);
  config.tls_key = key;
  config.tls_cert = (dir.path() / "missing.pem").string();
  EXPECT_EQ(tls_load(), TlsLoad::kept);
  EXPECT_TRUE(tls_available());

  // With nothing loaded before, TLS is off.
  tls_reset();
  EXPECT_EQ(tls_load(), TlsLoad::off);
  EXPECT_FALSE(tls_available());
  write_file(dir.path() / "garbage.pem", "-----BEGIN CERTIFICATE-----\nnonsense\n-----END CERTIFICATE-----\n");
  config.tls_cert = (dir.path() / "garbage.pem").string();
  EXPECT_EQ(tls_load(), TlsLoad::off);
  config.tls_cert = cert;
  EXPECT_EQ(tls_load(), TlsLoad::loaded);

  // A key under a passphrase is refused with its reason, never asked for.
  std::string pem = read_file(key);
  std::unique_ptr<BIO, decltype(&BIO_free)> in{BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())), BIO_free};
  std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)> pkey{PEM_read_bio_PrivateKey(in.get(), nullptr, nullptr, nullptr),
                                                           EVP_PKEY_free};
  std::unique_ptr<BIO, decltype(&BIO_free)> out{BIO_new(BIO_s_mem()), BIO_free};
  ASSERT_TRUE(pkey && out);
  ASSERT_EQ(PEM_write_bio_PrivateKey(out.get(), pkey.get(), EVP_aes_128_cbc(), nullptr, 0, nullptr,
                                     const_cast<char*>("secret")), 1);
  char* data = nullptr;
  long n = BIO_get_mem_data(out.get(), &data);
  write_file(dir.path() / "locked.key", std::string(data, static_cast<std::size_t>(n)));
  config.tls_key = (dir.path() / "locked.key").string();
  log_parse("1 " + (dir.path() / "errors").string() + "\n");
  EXPECT_EQ(tls_load(), TlsLoad::kept);
  log_flush_all();
  EXPECT_NE(read_file(dir.path() / "errors").find("locked.key is protected by a passphrase"), std::string::npos)
      << read_file(dir.path() / "errors");
  log_parse("");
}

TEST_F(TlsTest, TwinServicesShareTheirPlainServicesSessionsUnderTheirOwnKeys) {
  service_register({.number = svc::smtp, .name = "smtp", .port = &config.smtp_sock_port,
                    .allow = &config.smtp_allow, .line_limit = 512});
  tls_register_services();
  const ServiceDescriptor* smtps = service_find(svc::smtps);
  const ServiceDescriptor* submission = service_find(svc::submission);
  ASSERT_TRUE(smtps && submission);
  EXPECT_TRUE(smtps->implicit_tls);
  EXPECT_FALSE(submission->implicit_tls);
  EXPECT_EQ(smtps->port, &config.smtps_sock_port);
  EXPECT_EQ(submission->enabled, &config.submission_sock_enabled);
  EXPECT_EQ(smtps->allow, &config.smtp_allow);
  EXPECT_EQ(smtps->line_limit, 512u);
  EXPECT_EQ(smtps->plain, svc::smtp);
  EXPECT_EQ(service_find(svc::pops), nullptr);  // no POP3 service, no twin
  EXPECT_EQ(service_find(svc::imaps), nullptr);
}

}  // namespace
}  // namespace velmor
