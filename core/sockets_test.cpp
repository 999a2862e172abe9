// The dispatcher over loopback: a small test service registered under a real
// service number, real client sockets, and the dispatcher pumped in between.
#include "core/sockets.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <stdexcept>
#include <string>
#include <vector>

#include "core/config.h"
#include "core/control.h"
#include "core/globals.h"

namespace velmor {
namespace {

using Clock = std::chrono::steady_clock;

// Runs dispatcher passes until `done` holds (or three seconds pass).
template <class Pred>
bool pump(Pred done, int ms = 3000) {
  auto end = Clock::now() + std::chrono::milliseconds(ms);
  while (!done()) {
    if (Clock::now() > end) return false;
    server_now = std::time(nullptr);
    dispatcher(10);
  }
  return true;
}

int connect_to(int port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<std::uint16_t>(port));
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// Collects what a client socket received so far; false once the peer closed.
struct Client {
  int fd = -1;
  std::string got;
  bool eof = false;
  explicit Client(int port) : fd(connect_to(port)) {}
  ~Client() {
    if (fd >= 0) ::close(fd);
  }
  void poll_in() {
    char buf[65536];
    for (;;) {
      ssize_t n = ::recv(fd, buf, sizeof buf, MSG_DONTWAIT);
      if (n > 0) got.append(buf, static_cast<std::size_t>(n));
      if (n == 0) eof = true;
      if (n <= 0) return;
    }
  }
  bool wait_for(std::string_view text) {
    return pump([&] {
      poll_in();
      return got.find(text) != std::string::npos;
    });
  }
  bool wait_eof() {
    return pump([&] {
      poll_in();
      return eof;
    });
  }
  void send(std::string_view text) { ASSERT_EQ(::send(fd, text.data(), text.size(), 0), static_cast<ssize_t>(text.size())); }
};

// The first accepted connection's record.
SocketRecord* first_connection() {
  for (int fd = 0; fd < 4096; ++fd)
    if (SocketRecord* x = record_for(fd); x && x->state == sockstate::initial) return x;
  return nullptr;
}

int bound_port(int fd) {
  sockaddr_in a{};
  socklen_t len = sizeof a;
  getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len);
  return ntohs(a.sin_port);
}

class DispatcherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    server_now = std::time(nullptr);
    paths.bind_address = "127.0.0.1";
    config.sock_buffer = 4096;
    register_service(svc::smtp, echo_handlers());
    ASSERT_EQ(listener_open(0, svc::smtp, 6, &listen_fd), 0);
    port = bound_port(listen_fd);
  }
  void TearDown() override {
    sockets_close_all();
    EXPECT_EQ(connection_count(svc::smtp), 0);
    EXPECT_EQ(record_count(), 0u);
  }

  // Greets, echoes each line, and understands a few words: "quit" closes
  // from inside the handler, "bye" replies and closes after sending.
  ServiceHandlers echo_handlers() {
    ServiceHandlers h;
    h.max_connections = [this] { return max_connections; };
    h.idle_timeout = [] { return 5; };
    h.accept = [](SocketRecord& r) {
      r.write_buf.append("hello " + r.peer_addr + "\r\n");
      return 0;
    };
    h.read = [this](SocketRecord& r, long n) {
      bytes_read += n;
      if (!consume) return 0;
      std::string_view in = r.read_buf.view();
      std::size_t eol;
      while ((eol = in.find('\n')) != std::string_view::npos) {
        std::string line(in.substr(0, eol + 1));
        r.read_buf.consume(eol + 1);
        in = r.read_buf.view();
        if (line == "quit\n") {
          socket_close(r.fd);
          r.write_buf.append("ignored");  // the record stays valid until the pass ends
          return 0;
        }
        if (line == "bye\n") {
          r.write_buf.append("bye\r\n");
          r.state = sockstate::closing;
          return 0;
        }
        r.write_buf.append("echo " + line);
      }
      return 0;
    };
    h.release = [this](SocketRecord&) { ++released; };
    return h;
  }

  int listen_fd = -1;
  int port = 0;
  int max_connections = 20;
  int released = 0;
  long bytes_read = 0;
  bool consume = true;
};

TEST_F(DispatcherTest, AcceptReadWriteAndPeerClose) {
  {
    Client c(port);
    ASSERT_TRUE(c.wait_for("hello 127.0.0.1\r\n"));
    EXPECT_EQ(connection_count(svc::smtp), 1);
    c.send("one\ntwo\n");
    ASSERT_TRUE(c.wait_for("echo two\n"));
    EXPECT_EQ(c.got, "hello 127.0.0.1\r\necho one\necho two\n");
  }
  // The client is gone: the record is released once and the count drops.
  ASSERT_TRUE(pump([&] { return released == 1; }));
  EXPECT_EQ(connection_count(svc::smtp), 0);
  EXPECT_EQ(accepted_total() > 0, true);
}

TEST_F(DispatcherTest, CloseFromInsideTheHandlerAndAfterSending) {
  Client a(port), b(port);
  ASSERT_TRUE(a.wait_for("hello"));
  ASSERT_TRUE(b.wait_for("hello"));
  a.send("quit\n");
  ASSERT_TRUE(a.wait_eof());
  EXPECT_EQ(a.got.find("ignored"), std::string::npos);
  b.send("x\nbye\n");
  ASSERT_TRUE(b.wait_eof());
  EXPECT_NE(b.got.find("echo x\nbye\r\n"), std::string::npos);
  EXPECT_EQ(released, 2);
  // A new connection may reuse a freed descriptor at once.
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
}

TEST_F(DispatcherTest, ConnectionLimitLeavesTheThirdClientWaiting) {
  max_connections = 2;
  auto a = std::make_unique<Client>(port);
  Client b(port);
  ASSERT_TRUE(a->wait_for("hello"));
  ASSERT_TRUE(b.wait_for("hello"));
  Client c(port);  // connects into the backlog
  pump([] { return false; }, 300);
  c.poll_in();
  EXPECT_EQ(c.got, "");
  EXPECT_EQ(connection_count(svc::smtp), 2);
  a.reset();
  // Served without reconnecting once a slot is free.
  ASSERT_TRUE(c.wait_for("hello"));
  c.send("late\n");
  ASSERT_TRUE(c.wait_for("echo late\n"));
}

TEST_F(DispatcherTest, IdleConnectionsAreClosedEveryTick) {
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
  server_now = std::time(nullptr) + 5;
  sockets_check_timeouts();
  EXPECT_EQ(connection_count(svc::smtp), 1);  // exactly the limit: still allowed
  server_now = std::time(nullptr) + 6;
  sockets_check_timeouts();
  EXPECT_EQ(connection_count(svc::smtp), 0);
  ASSERT_TRUE(c.wait_eof());
}

TEST_F(DispatcherTest, ABusySessionStillEndsAtItsLimit) {
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
  SocketRecord* r = first_connection();
  ASSERT_NE(r, nullptr);
  r->created = server_now - 3601;  // an hour old, active just now
  config.sock_session_max = 0;  // no limit
  sockets_check_timeouts();
  EXPECT_EQ(connection_count(svc::smtp), 1);
  config.sock_session_max = 3600;
  sockets_check_timeouts();
  EXPECT_EQ(connection_count(svc::smtp), 0);
}

TEST_F(DispatcherTest, AHandlerThatThrowsLosesItsConnectionOnly) {
  ServiceHandlers h = echo_handlers();
  h.read = [echo = h.read](SocketRecord& r, long n) -> int {
    if (r.read_buf.view().starts_with("boom")) throw std::runtime_error("boom");
    return echo(r, n);
  };
  register_service(svc::smtp, h);
  Client a(port), b(port);
  ASSERT_TRUE(a.wait_for("hello"));
  ASSERT_TRUE(b.wait_for("hello"));
  a.send("boom\n");
  ASSERT_TRUE(a.wait_eof());
  EXPECT_EQ(released, 1);
  b.send("still here\n");
  ASSERT_TRUE(b.wait_for("echo still here\n"));
}

TEST_F(DispatcherTest, AFullInputBufferIsNeverReadInto) {
  consume = false;
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
  std::string big(3 * 4096, 'x');
  c.send(big);
  pump([] { return false; }, 300);
  // Exactly one buffer's worth was taken in; the rest waits in the socket.
  EXPECT_EQ(bytes_read, 4096);
}

// The service streams more than the socket takes at once to a client that
// reads slowly: every byte arrives once and in order.
TEST_F(DispatcherTest, PartialSendsKeepTheRestInOrder) {
  const std::size_t total = 3 * 1024 * 1024;
  std::size_t produced = 0;
  ServiceHandlers h = echo_handlers();
  auto fill = [&](SocketRecord& r) {
    while (produced < total && r.write_buf.room() > 0) {
      char ch = static_cast<char>('a' + (produced / 1000) % 26);
      std::size_t n = std::min<std::size_t>(r.write_buf.room(), 1000 - produced % 1000);
      n = std::min(n, total - produced);
      r.write_buf.append(std::string(n, ch));
      produced += n;
    }
    r.want_write = produced < total;
    return 0;
  };
  h.accept = [&](SocketRecord& r) { return fill(r); };
  h.write = fill;
  register_service(svc::smtp, h);
  Client c(port);
  int small = 4096;
  setsockopt(c.fd, SOL_SOCKET, SO_RCVBUF, &small, sizeof small);
  ASSERT_TRUE(pump([&] {
    c.poll_in();
    return c.got.size() >= total;
  }, 20000));
  ASSERT_EQ(c.got.size(), total);
  for (std::size_t i = 0; i < total; i += 999)
    ASSERT_EQ(c.got[i], static_cast<char>('a' + (i / 1000) % 26)) << i;
}

TEST_F(DispatcherTest, SocketSendMovesTheUnsentRestToTheFront) {
  Client c(port);  // never reads, so the socket fills up
  ASSERT_TRUE(c.wait_for("hello"));
  SocketRecord* r = first_connection();
  ASSERT_NE(r, nullptr);
  auto byte_at = [](std::size_t k) { return static_cast<char>('a' + k % 23); };
  std::size_t appended = 0, sent = 0;
  for (int round = 0; round < 100000; ++round) {
    while (r->write_buf.room() > 0) r->write_buf.append(std::string(1, byte_at(appended++)));
    std::size_t before = r->write_buf.size();
    long n = socket_send(*r);
    ASSERT_GE(n, 0);
    sent += static_cast<std::size_t>(n);
    if (static_cast<std::size_t>(n) < before) {
      // The unsent rest now starts the buffer, in order.
      ASSERT_EQ(r->write_buf.size(), before - static_cast<std::size_t>(n));
      for (std::size_t i = 0; i < r->write_buf.size(); ++i)
        ASSERT_EQ(r->write_buf.data()[i], byte_at(sent + i)) << i;
      return;
    }
  }
  FAIL() << "the socket never filled";
}

TEST(OutwardConnect, RefusedGoesToConnectFailedAndSuccessToConnected) {
  server_now = std::time(nullptr);
  // A port nobody listens on.
  int probe = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  ASSERT_EQ(::bind(probe, reinterpret_cast<sockaddr*>(&a), sizeof a), 0);
  a.sin_port = htons(static_cast<std::uint16_t>(bound_port(probe)));
  ::close(probe);

  int failed = 0, done = 0;
  ServiceHandlers h;
  h.connect_failed = [&](SocketRecord& r) {
    ++failed;
    socket_close(r.fd);
  };
  h.connect_done = [&](SocketRecord& r) {
    ++done;
    EXPECT_EQ(r.state, sockstate::connected);
    r.write_buf.append("HELO\r\n");
  };
  register_service(svc::smtp_client, h);

  int fd = socket_connect(a);
  if (fd >= 0) {  // otherwise refused at once, which is also a failure reported
    ASSERT_NE(record_create(fd, svc::smtp_client, sockstate::connecting), nullptr);
    ASSERT_TRUE(pump([&] { return failed == 1; }));
  }
  EXPECT_EQ(connection_count(svc::smtp_client), 0);

  int server = ::socket(AF_INET, SOCK_STREAM, 0);
  a.sin_port = 0;
  ASSERT_EQ(::bind(server, reinterpret_cast<sockaddr*>(&a), sizeof a), 0);
  ASSERT_EQ(::listen(server, 4), 0);
  a.sin_port = htons(static_cast<std::uint16_t>(bound_port(server)));
  fd = socket_connect(a);
  ASSERT_GE(fd, 0);
  ASSERT_NE(record_create(fd, svc::smtp_client, sockstate::connecting), nullptr);
  ASSERT_TRUE(pump([&] { return done == 1; }));
  int peer = ::accept(server, nullptr, nullptr);
  char buf[16] = {};
  timeval tv{3, 0};
  setsockopt(peer, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  EXPECT_EQ(::recv(peer, buf, sizeof buf, 0), 6);
  EXPECT_STREQ(buf, "HELO\r\n");
  EXPECT_EQ(connection_count(svc::smtp_client), 1);
  sockets_close_all();
  EXPECT_EQ(connection_count(svc::smtp_client), 0);
  ::close(peer);
  ::close(server);
  sockaddr_in zero{};
  EXPECT_EQ(socket_connect(zero), -1);
}

TEST(Lookup, TheEndOfALookupReachesTheService) {
  server_now = std::time(nullptr);
  int done = 0, failed = 0;
  ServiceHandlers h;
  h.lookup_done = [&](SocketRecord&) { ++done; };
  h.lookup_failed = [&](SocketRecord& r) {
    ++failed;
    socket_close(r.fd);
  };
  register_service(svc::pop_client, h);
  int fd1 = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  int fd2 = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  SocketRecord* a = record_create(fd1, svc::pop_client, sockstate::lookup);
  SocketRecord* b = record_create(fd2, svc::pop_client, sockstate::lookup);
  ASSERT_TRUE(a && b);
  dispatcher(0);
  EXPECT_EQ(done + failed, 0);
  record_lookup_complete(*a, true);
  record_lookup_complete(*b, false);
  dispatcher(0);
  EXPECT_EQ(done, 1);
  EXPECT_EQ(failed, 1);
  EXPECT_EQ(record_for(fd2), nullptr);
  sockets_close_all();
}

// Thousands of idle connections, most on descriptors above 1024, and the
// control channel still answers within one pass.
TEST(ManyConnections, TwoThousandIdleClientsAndTheControlChannelAnswers) {
  rlimit lim{};
  getrlimit(RLIMIT_NOFILE, &lim);
  if (lim.rlim_max < 4500) GTEST_SKIP() << "descriptor limit too low";
  lim.rlim_cur = std::max<rlim_t>(lim.rlim_cur, 4500);
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &lim), 0);

  server_now = std::time(nullptr);
  paths.bind_address = "127.0.0.1";
  char dir[] = "/tmp/velmor-sockets-XXXXXX";
  ASSERT_NE(mkdtemp(dir), nullptr);
  paths.control = std::string(dir) + "/control";
  ServiceHandlers h;
  h.max_connections = [] { return 5000; };
  h.accept = [](SocketRecord& r) { return r.write_buf.append("+\r\n") ? 0 : 1; };
  register_service(svc::pop, h);
  int listen_fd = -1;
  ASSERT_EQ(listener_open(0, svc::pop, 6, &listen_fd), 0);
  int port = bound_port(listen_fd);
  control_open();

  std::vector<int> clients;
  for (int i = 0; i < 2000; ++i) {
    int fd = connect_to(port);
    ASSERT_GE(fd, 0) << i;
    clients.push_back(fd);
    if (i % 50 == 49) {  // keep the backlog from overflowing
      dispatcher(0);
      dispatcher(0);
    }
  }
  ASSERT_TRUE(pump([&] { return connection_count(svc::pop) == 2000; }, 10000));
  EXPECT_GT(clients.back(), 1024);

  int ctl = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un self{};
  self.sun_family = AF_UNIX;
  ASSERT_EQ(::bind(ctl, reinterpret_cast<sockaddr*>(&self), sizeof(sa_family_t)), 0);
  sockaddr_un to{};
  to.sun_family = AF_UNIX;
  std::snprintf(to.sun_path, sizeof to.sun_path, "%s", paths.control.c_str());
  ASSERT_EQ(::sendto(ctl, "test\n", 5, 0, reinterpret_cast<sockaddr*>(&to), sizeof to), 5);
  dispatcher(1000);
  char buf[64] = {};
  ASSERT_GT(::recv(ctl, buf, sizeof buf - 1, MSG_DONTWAIT), 5);
  EXPECT_EQ(std::string(buf), "test:" + std::to_string(server_now) + "\n");

  for (int fd : clients) ::close(fd);
  ASSERT_TRUE(pump([&] { return connection_count(svc::pop) == 0; }, 10000));
  ::close(ctl);
  sockets_close_all();
  control_remove();
  EXPECT_EQ(::access(paths.control.c_str(), F_OK), -1);
  ::rmdir(dir);
}

TEST(PeerShare, OneAddressHoldsAQuarterOfTheSlotsAndLoopbackAny) {
  register_service(svc::nntp, {.max_connections = [] { return 8; }});
  const std::uint32_t stranger = inet_addr("192.0.2.7");
  int fds[2];
  for (int& fd : fds) {
    EXPECT_TRUE(peer_may_connect(svc::nntp, stranger));
    fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    record_set_peer(*record_create(fd, svc::nntp, sockstate::initial), stranger);
  }
  EXPECT_FALSE(peer_may_connect(svc::nntp, stranger));
  EXPECT_TRUE(peer_may_connect(svc::nntp, inet_addr("192.0.2.8")));
  EXPECT_TRUE(peer_may_connect(svc::nntp, inet_addr("127.0.0.9")));
  socket_close(fds[0]);
  EXPECT_TRUE(peer_may_connect(svc::nntp, stranger));
  sockets_close_all();
}

TEST(Telnet, NegotiationIsAnsweredAndStripped) {
  SocketRecord r;
  r.read_buf = IoBuffer(64);
  r.write_buf = IoBuffer(64);
  const char in[] = "\xff\xfd\x01\xff\xfb\x03\x02host.example\r\n";
  r.read_buf.append(std::string_view(in, sizeof in - 1));
  EXPECT_EQ(telnet_filter(r), 1);
  EXPECT_EQ(r.write_buf.view(), std::string_view("\xff\xfc\x01\xff\xfe\x03", 6));
  EXPECT_EQ(r.read_buf.view(), "host.example\r\n");

  // An unfinished sequence waits for the rest.
  r.read_buf.clear();
  r.write_buf.clear();
  r.read_buf.append("\xff\xfd");
  EXPECT_EQ(telnet_filter(r), 0);
  EXPECT_EQ(r.read_buf.size(), 2u);
  r.read_buf.append("\x18x");
  EXPECT_EQ(telnet_filter(r), 1);
  EXPECT_EQ(r.write_buf.view(), "\xff\xfc\x18");
  EXPECT_EQ(r.read_buf.view(), "x");

  // No room for the answer: it is dropped, never written past the buffer.
  SocketRecord full;
  full.read_buf = IoBuffer(16);
  full.write_buf = IoBuffer(4);
  full.write_buf.append("abcd");
  full.read_buf.append("\xff\xfb\x01ok");
  EXPECT_EQ(telnet_filter(full), 1);
  EXPECT_EQ(full.write_buf.view(), "abcd");
  EXPECT_EQ(full.read_buf.view(), "ok");
}

TEST(Addresses, DottedAndPeerRules) {
  EXPECT_EQ(dotted(htonl(0x7f000001)), "127.0.0.1");
  EXPECT_EQ(dotted(htonl(0xc0a80a05)), "192.168.10.5");
  AddressList allow = address_list_parse("10.0.0.0/8");
  AddressList block = address_list_parse("all");
  AddressList auth = address_list_parse("192.168.0.0/16");
  EXPECT_EQ(peer_rule(htonl(0x0a010203), allow, block, &auth), PeerRule::allowed);
  EXPECT_EQ(peer_rule(htonl(0xc0a80001), allow, block, &auth), PeerRule::blocked);
  EXPECT_EQ(peer_rule(htonl(0xc0a80001), allow, {}, &auth), PeerRule::must_auth);
  EXPECT_EQ(peer_rule(htonl(0x01020304), allow, {}, &auth), PeerRule::ordinary);
}

}  // namespace
}  // namespace velmor
