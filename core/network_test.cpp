// The loop over loopback: a small line-echo service registered under a real
// service number, real client sockets, and the loop pumped in between.
#include "core/network.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <ifaddrs.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <functional>
#include <stdexcept>
#include <string>
#include <vector>

#include "core/control.h"
#include "core/hooks.h"
#include "core/telnet.h"
#include "core/test_files.h"
#include "core/test_fixture.h"

namespace velmor {
namespace {

using Clock = std::chrono::steady_clock;

// Runs passes of the loop, each waiting up to `wait` ms, until `done`
// holds (or `ms` pass).
template <class Pred>
bool pump(Pred done, int ms = 3000, int wait = 10) {
  auto end = Clock::now() + std::chrono::milliseconds(ms);
  while (!done()) {
    if (Clock::now() > end) return false;
    server_now = std::time(nullptr);
    net_pass(wait);
  }
  return true;
}

int connect_to_port(int port, std::uint32_t address_nbo = htonl(INADDR_LOOPBACK)) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<std::uint16_t>(port));
  a.sin_addr.s_addr = address_nbo;
  if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

// A client socket and what it received so far.
struct Client {
  int fd = -1;
  std::string got;
  bool eof = false;
  explicit Client(int port, std::uint32_t address = htonl(INADDR_LOOPBACK)) : fd(connect_to_port(port, address)) {}
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

struct Seen {
  std::vector<CloseReason> closes;
  Connection* last = nullptr;
  bool consume = true;
  int per_turn = 0;  // lines read before the session yields its turn (0: all)
};

// Greets, echoes each line, and understands a few words: "quit" closes at
// once, "bye" replies and closes after sending, "boom" throws.
class Echo : public Session {
 public:
  explicit Echo(Seen& seen) : seen_(seen) {}
  void on_open(Connection& c) override {
    seen_.last = &c;
    c.send("hello " + c.peer().text + "\r\n");
  }
  void on_input(Connection& c) override {
    if (!seen_.consume) return;
    std::string_view line;
    for (int n = 0;; ++n) {
      if (seen_.per_turn && n == seen_.per_turn) {
        c.yield_turn();
        return;
      }
      if (c.read_line(line) != LineResult::line) return;
      if (line == "quit") {
        c.close_now();
        c.send("ignored");  // the connection stays valid until the callback returns
        return;
      }
      if (line == "bye") {
        c.send("bye\r\n");
        c.close_after_send();
        return;
      }
      if (line == "boom") throw std::runtime_error("boom");
      c.send("echo " + std::string(line) + "\n");
    }
  }
  void on_close(Connection&, CloseReason reason) override { seen_.closes.push_back(reason); }

 private:
  Seen& seen_;
};

class NetworkTest : public SuiteTest {
 protected:
  void SetUp() override {
    SuiteTest::SetUp();
    paths.bind_address = "127.0.0.1";
    config.sock_buffer = 4096;
    service_register({.number = svc::smtp,
                      .name = "echo",
                      .port = &port_key,
                      .max = &max,
                      .timeout = &timeout,
                      .make_session = [this](Connection&, Admission) { return std::make_unique<Echo>(seen); }});
    port = net_listen(svc::smtp, 0);
    ASSERT_GT(port, 0);
    port_key = port;
  }
  void TearDown() override {
    net_close_all();
    EXPECT_EQ(connection_count(svc::smtp), 0);
    SuiteTest::TearDown();
  }

  std::int32_t port_key = 0;
  std::int32_t max = 20;
  std::int32_t timeout = 5;
  int port = 0;
  Seen seen;
};

TEST_F(NetworkTest, AcceptReadWriteAndPeerClose) {
  {
    Client c(port);
    ASSERT_TRUE(c.wait_for("hello 127.0.0.1\r\n"));
    EXPECT_EQ(connection_count(svc::smtp), 1);
    c.send("one\ntwo\r\n");
    ASSERT_TRUE(c.wait_for("echo two\n"));
    EXPECT_EQ(c.got, "hello 127.0.0.1\r\necho one\necho two\n");
  }
  // The client is gone: its session hears so once, and the count drops.
  ASSERT_TRUE(pump([&] { return seen.closes.size() == 1; }));
  EXPECT_EQ(seen.closes[0], CloseReason::peer_closed);
  EXPECT_EQ(connection_count(svc::smtp), 0);
  EXPECT_GT(accepted_total(), 0u);
}

// A session that yields its turn is served again at the next pass, after
// the others: a client pipelining fifty lines, one a pass, does not keep a
// second client waiting, and having finished sending it still gets all
// fifty answers before the close.
TEST_F(NetworkTest, AYieldedTurnComesBackAtTheNextPassAfterTheOthers) {
  seen.per_turn = 1;
  Client a(port), b(port);
  ASSERT_TRUE(a.wait_for("hello"));
  ASSERT_TRUE(b.wait_for("hello"));
  std::string lines;
  for (int i = 0; i < 50; ++i) lines += "line " + std::to_string(i) + "\n";
  a.send(lines);
  ::shutdown(a.fd, SHUT_WR);
  b.send("x\n");
  ASSERT_TRUE(b.wait_for("echo x\n"));
  a.poll_in();
  auto echoes = [&] { return std::count(a.got.begin(), a.got.end(), '\n'); };
  EXPECT_LT(echoes(), 10);
  ASSERT_TRUE(a.wait_eof());
  EXPECT_EQ(echoes(), 51);  // the greeting and every line
  EXPECT_NE(a.got.find("echo line 49\n"), std::string::npos);
}

TEST_F(NetworkTest, CloseFromInsideTheSessionAndAfterSending) {
  Client a(port), b(port);
  ASSERT_TRUE(a.wait_for("hello"));
  ASSERT_TRUE(b.wait_for("hello"));
  a.send("quit\n");
  ASSERT_TRUE(a.wait_eof());
  EXPECT_EQ(a.got.find("ignored"), std::string::npos);
  b.send("x\nbye\nnever\n");
  ASSERT_TRUE(b.wait_eof());
  EXPECT_NE(b.got.find("echo x\nbye\r\n"), std::string::npos);
  EXPECT_EQ(b.got.find("never"), std::string::npos);
  EXPECT_EQ(seen.closes, (std::vector<CloseReason>{CloseReason::requested, CloseReason::requested}));
  // A new connection may reuse a freed descriptor at once.
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
}

TEST_F(NetworkTest, ConnectionLimitLeavesTheThirdClientWaiting) {
  max = 2;
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

TEST_F(NetworkTest, IdleAndOverlongConnectionsAreClosedOnTheTick) {
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
  const std::time_t start = server_now;
  server_now = start + 5;
  net_tick();
  EXPECT_EQ(connection_count(svc::smtp), 1);  // exactly the limit: still allowed
  server_now = start + 6;
  net_tick();
  EXPECT_EQ(connection_count(svc::smtp), 0);
  ASSERT_TRUE(c.wait_eof());
  EXPECT_EQ(seen.closes, std::vector<CloseReason>{CloseReason::timed_out});

  // A session busy all the time still ends at sock.session.max.
  timeout = 0;
  config.sock_session_max = 3600;
  Client d(port);
  ASSERT_TRUE(d.wait_for("hello"));
  server_now = std::time(nullptr) + 3601;
  net_tick();
  EXPECT_EQ(connection_count(svc::smtp), 0);
  EXPECT_EQ(seen.closes.back(), CloseReason::session_limit);
}

TEST_F(NetworkTest, ASessionThatThrowsLosesItsConnectionOnly) {
  Client a(port), b(port);
  ASSERT_TRUE(a.wait_for("hello"));
  ASSERT_TRUE(b.wait_for("hello"));
  a.send("boom\n");
  ASSERT_TRUE(a.wait_eof());
  EXPECT_EQ(seen.closes, std::vector<CloseReason>{CloseReason::failed});
  b.send("still here\n");
  ASSERT_TRUE(b.wait_for("echo still here\n"));
}

TEST_F(NetworkTest, AFullInputBufferIsNeverReadInto) {
  seen.consume = false;
  Client c(port);
  ASSERT_TRUE(c.wait_for("hello"));
  c.send(std::string(3 * 4096, 'x'));
  pump([] { return false; }, 300);
  // Exactly one buffer's worth was taken in; the rest waits in the socket.
  EXPECT_EQ(seen.last->bytes_received(), 4096u);
}

// A file range far larger than any buffer, with bytes around it, to a
// client that reads slowly: every byte arrives once and in order.
TEST_F(NetworkTest, FileRangesAndBytesReachASlowReaderInOrder) {
  testing_files::ScratchDir dir;
  const std::string path = (dir.path() / "big").string();
  std::string content;
  for (std::size_t i = 0; content.size() < 3 * 1024 * 1024; ++i) content += std::to_string(i) + "\r\n";
  testing_files::write_file(path, content);
  auto file = std::make_shared<const UniqueFd>(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  struct Streamer : Session {
    std::shared_ptr<const UniqueFd> file;
    std::uint64_t size;
    void on_open(Connection& c) override {
      c.send("start\n");
      c.send_file({.file = file, .offset = 0, .length = size});
      c.send("end\n");
    }
    void on_input(Connection&) override {}
  };
  service_register({.number = svc::smtp, .port = &port_key, .make_session = [&](Connection&, Admission) {
                      auto s = std::make_unique<Streamer>();
                      s->file = file;
                      s->size = content.size();
                      return s;
                    }});
  Client c(port);
  ASSERT_TRUE(pump([&] {
    c.poll_in();
    return c.got.size() >= content.size() + 10;
  }, 20000, 0)) << c.got.size() << " of " << content.size();
  EXPECT_EQ(c.got.size(), content.size() + 10);
  EXPECT_TRUE(c.got == "start\n" + content + "end\n");
}

// Any way a connection goes, its lookup goes with it at once.
TEST_F(NetworkTest, OutwardConnectionsLookUpConnectAndFail) {
  struct Dialer : Session {
    Seen& seen;
    explicit Dialer(Seen& s) : seen(s) {}
    void on_open(Connection& c) override {
      seen.last = &c;
      c.send("HELO\r\n");
    }
    void on_input(Connection&) override {}
    void on_close(Connection&, CloseReason r) override { seen.closes.push_back(r); }
  };
  std::vector<std::string> asked;
  std::vector<std::uint64_t> cancelled;
  std::function<void(std::uint32_t)> answer;
  net_set_resolver({.start = [&](std::string_view name, std::function<void(std::uint32_t)> done) {
                      asked.emplace_back(name);
                      answer = std::move(done);
                      return std::uint64_t{77};
                    },
                    .cancel = [&](std::uint64_t h) { cancelled.push_back(h); }});

  // A name nobody can resolve.
  Connection* c = connect_to(svc::smtp_client, "far.example", 25, std::make_unique<Dialer>(seen));
  ASSERT_NE(c, nullptr);
  EXPECT_EQ(c->phase(), Phase::lookup);
  EXPECT_EQ(asked, std::vector<std::string>{"far.example"});
  answer(0);
  ASSERT_TRUE(pump([&] { return seen.closes.size() == 1; }));
  EXPECT_EQ(seen.closes[0], CloseReason::lookup_failed);

  // Closed while it waits: the lookup is cancelled then and there.
  c = connect_to(svc::smtp_client, "slow.example", 25, std::make_unique<Dialer>(seen));
  c->close_now();
  EXPECT_EQ(cancelled, std::vector<std::uint64_t>{77});
  EXPECT_EQ(seen.closes.back(), CloseReason::requested);
  EXPECT_EQ(connection_count(svc::smtp_client), 0);

  // A port nobody listens on.
  connect_to(svc::smtp_client, "127.0.0.1", LoopbackPeer(false).port, std::make_unique<Dialer>(seen));
  ASSERT_TRUE(pump([&] { return seen.closes.size() == 3; }));
  EXPECT_EQ(seen.closes.back(), CloseReason::connect_failed);

  // A name that resolves, to a server that answers.
  LoopbackPeer server;
  c = connect_to(svc::smtp_client, "near.example", server.port, std::make_unique<Dialer>(seen));
  answer(htonl(INADDR_LOOPBACK));
  ASSERT_TRUE(pump([&] { return seen.last == c && c->phase() == Phase::open; }));
  EXPECT_EQ(connection_count(svc::smtp_client), 1);
  EXPECT_EQ(c->peer().text, "127.0.0.1");
  UniqueFd peer(::accept(server.fd.get(), nullptr, nullptr));
  char buf[16] = {};
  timeval tv{3, 0};
  setsockopt(peer.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  EXPECT_EQ(::recv(peer.get(), buf, sizeof buf, 0), 6);
  EXPECT_STREQ(buf, "HELO\r\n");
  net_close_all();
  EXPECT_EQ(seen.closes.back(), CloseReason::shutdown);
  EXPECT_EQ(connection_count(svc::smtp_client), 0);
}

// A relay: what one peer sends goes to the other. Its reader is slow, so
// reading from the sender pauses: memory stays bounded and every byte
// arrives in order once the reader catches up.
TEST_F(NetworkTest, ARelayPausesItsSenderWhileThePartnerIsBacklogged) {
  struct Relay : Session {
    void on_input(Connection& c) override {
      if (Connection* to = c.partner()) {
        std::string_view in = c.buffered();
        to->send(in);
        c.consume(in.size());
      }
    }
    void on_close(Connection& c, CloseReason) override {
      if (Connection* to = c.partner()) to->close_after_send();
    }
  };
  LoopbackPeer far;
  Connection* inner = nullptr;
  Connection* outer = nullptr;
  service_register({.number = svc::smtp, .port = &port_key, .paced_by_lines = false});
  ServiceDescriptor d = *service_find(svc::smtp);
  d.make_session = [&](Connection& c, Admission) {
    inner = &c;
    outer = connect_to(svc::telnet_server, "127.0.0.1", far.port, std::make_unique<Relay>());
    c.link(*outer);
    return std::make_unique<Relay>();
  };
  service_register(d);

  Client sender(port);
  int small = 8192;
  setsockopt(sender.fd, SOL_SOCKET, SO_SNDBUF, &small, sizeof small);
  ASSERT_TRUE(pump([&] { return outer && outer->phase() == Phase::open; }));
  int reader = ::accept(far.fd.get(), nullptr, nullptr);
  std::string sent;
  for (std::size_t i = 0; sent.size() < 12 * 1024 * 1024; ++i) sent += std::to_string(i) + ",";
  ASSERT_EQ(fcntl(sender.fd, F_SETFL, O_NONBLOCK), 0);
  std::size_t at = 0;
  auto push = [&] {
    ssize_t n = ::send(sender.fd, sent.data() + at, sent.size() - at, MSG_DONTWAIT);
    if (n > 0) at += static_cast<std::size_t>(n);
  };
  // The reader does not read: once the kernel's buffers are full the
  // relay stops reading from the sender, and holds little itself.
  std::uint64_t received = 0;
  ASSERT_TRUE(pump([&] {
    push();
    std::uint64_t now = inner->bytes_received();
    bool still = now == received && outer->pending() > 0;
    received = now;
    return still && at < sent.size();
  }, 10000, 50));
  EXPECT_LE(outer->pending(), Connection::kHighWater + 4096);
  // Now it reads, and everything comes through in order.
  std::string got;
  ASSERT_TRUE(pump([&] {
    push();
    char buf[65536];
    ssize_t n;
    while ((n = ::recv(reader, buf, sizeof buf, MSG_DONTWAIT)) > 0) got.append(buf, static_cast<std::size_t>(n));
    return got.size() >= sent.size();
  }, 60000, 0));
  EXPECT_TRUE(got == sent) << got.size() << " of " << sent.size();
  ::close(reader);
}

// Thousands of idle connections, most on descriptors above 1024, and the
// control channel (a watched datagram socket) still answers within a pass.
TEST_F(NetworkTest, TwoThousandIdleClientsAndTheControlChannelAnswers) {
  rlimit lim{};
  getrlimit(RLIMIT_NOFILE, &lim);
  if (lim.rlim_max < 4500) GTEST_SKIP() << "descriptor limit too low";
  lim.rlim_cur = std::max<rlim_t>(lim.rlim_cur, 4500);
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &lim), 0);
  max = 5000;
  testing_files::ScratchDir dir;
  paths.control = (dir.path() / "control").string();
  ASSERT_EQ(control_open(), 0);

  std::vector<int> clients;
  for (int i = 0; i < 2000; ++i) {
    int fd = connect_to_port(port);
    ASSERT_GE(fd, 0) << i;
    clients.push_back(fd);
    if (i % 50 == 49) {  // keep the backlog from overflowing
      net_pass(0);
      net_pass(0);
    }
  }
  ASSERT_TRUE(pump([&] { return connection_count(svc::smtp) == 2000; }, 10000));
  EXPECT_GT(clients.back(), 1024);

  int ctl = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un self{};
  self.sun_family = AF_UNIX;
  ASSERT_EQ(::bind(ctl, reinterpret_cast<sockaddr*>(&self), sizeof(sa_family_t)), 0);
  sockaddr_un to{};
  to.sun_family = AF_UNIX;
  std::snprintf(to.sun_path, sizeof to.sun_path, "%s", paths.control.c_str());
  ASSERT_EQ(::sendto(ctl, "test\n", 5, 0, reinterpret_cast<sockaddr*>(&to), sizeof to), 5);
  net_pass(1000);
  char buf[64] = {};
  ASSERT_GT(::recv(ctl, buf, sizeof buf - 1, MSG_DONTWAIT), 5);
  EXPECT_EQ(std::string(buf), "test:" + std::to_string(server_now) + "\n");

  for (int fd : clients) ::close(fd);
  ASSERT_TRUE(pump([&] { return connection_count(svc::smtp) == 0; }, 10000));
  ::close(ctl);
  control_remove();
  EXPECT_EQ(::access(paths.control.c_str(), F_OK), -1);
}

// A listing far longer than a reader's queue (ten datagrams) reaches a
// reader that takes one datagram per pass whole and in order: the rest
// waits for room, and the loop does not wait for the reader.
TEST_F(NetworkTest, AQueueListingWaitsForItsReader) {
  testing_files::ScratchDir dir;
  paths.control = (dir.path() / "control").string();
  hooks.list_mail_queue = [](const std::function<void(std::string_view)>& send) {
    send("start mq\n");
    for (int i = 0; i < 100; ++i) send("entry " + std::to_string(i));
    send("end mq\n");
  };
  ASSERT_EQ(control_open(), 0);
  UniqueFd reader(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un self{};
  self.sun_family = AF_UNIX;
  ASSERT_EQ(::bind(reader.get(), reinterpret_cast<sockaddr*>(&self), sizeof(sa_family_t)), 0);
  sockaddr_un to{};
  to.sun_family = AF_UNIX;
  std::snprintf(to.sun_path, sizeof to.sun_path, "%s", paths.control.c_str());
  ASSERT_EQ(::sendto(reader.get(), "listmq", 6, 0, reinterpret_cast<sockaddr*>(&to), sizeof to), 6);
  std::vector<std::string> got;
  ASSERT_TRUE(pump([&] {
    char buf[64];
    ssize_t n = ::recv(reader.get(), buf, sizeof buf, MSG_DONTWAIT);
    if (n > 0) got.emplace_back(buf, static_cast<std::size_t>(n));
    return !got.empty() && got.back() == "end mq\n";
  })) << got.size() << " " << (got.empty() ? std::string() : got.back());
  ASSERT_EQ(got.size(), 102u);
  EXPECT_EQ(got[0], "start mq\n");
  EXPECT_EQ(got[57], "entry 56");
  control_remove();
}

// One address holds at most a quarter of a service's slots; loopback any.
TEST_F(NetworkTest, OnePeerHoldsAQuarterOfTheSlots) {
  // A peer that is not loopback: this host's own address on another interface.
  std::uint32_t outside = 0;
  ifaddrs* list = nullptr;
  if (getifaddrs(&list) == 0) {
    for (ifaddrs* i = list; i && !outside; i = i->ifa_next)
      if (i->ifa_addr && i->ifa_addr->sa_family == AF_INET) {
        std::uint32_t ip = reinterpret_cast<sockaddr_in*>(i->ifa_addr)->sin_addr.s_addr;
        if ((ntohl(ip) >> 24) != 127) outside = ip;
      }
    freeifaddrs(list);
  }
  if (!outside) GTEST_SKIP() << "no address outside loopback";
  max = 8;
  paths.bind_address = "";
  net_close_all();
  ASSERT_EQ(net_start(), 0);
  std::vector<std::unique_ptr<Client>> strangers;
  for (int i = 0; i < 3; ++i) strangers.push_back(std::make_unique<Client>(port, outside));
  ASSERT_TRUE(strangers[0]->wait_for("hello"));
  ASSERT_TRUE(strangers[1]->wait_for("hello"));
  ASSERT_TRUE(strangers[2]->wait_eof());  // the third is turned away
  EXPECT_EQ(strangers[2]->got, "");
  Client local(port), local2(port), local3(port);
  ASSERT_TRUE(local3.wait_for("hello"));
  strangers[0].reset();
  ASSERT_TRUE(pump([&] { return connection_count(svc::smtp) == 4; }));
  Client again(port, outside);
  ASSERT_TRUE(again.wait_for("hello"));
}

TEST_F(NetworkTest, TheAcceptRuleIsOneTestForEveryService) {
  ServiceDescriptor d{.allow = &config.smtp_allow, .block = &config.smtp_block, .auth = &config.smtp_auth};
  config.smtp_allow = address_list_parse("10.0.0.0/8");
  config.smtp_block = address_list_parse("all");
  config.smtp_auth = address_list_parse("192.168.0.0/16");
  EXPECT_EQ(service_admit(d, htonl(0x0a010203)), Admission::accepted);
  EXPECT_EQ(service_admit(d, htonl(0xc0a80001)), Admission::refused);
  config.smtp_block.clear();
  EXPECT_EQ(service_admit(d, htonl(0xc0a80001)), Admission::identify);
  EXPECT_EQ(service_admit(d, htonl(0x01020304)), Admission::accepted);
  EXPECT_EQ(dotted(htonl(0xc0a80a05)), "192.168.10.5");
}

TEST(Telnet, NegotiationIsAnsweredAndStripped) {
  std::string answers;
  const char in[] = "\xff\xfd\x01\xff\xfb\x03\x02host.example\r\n";
  std::string_view input(in, sizeof in - 1);
  EXPECT_EQ(input.substr(telnet_strip(input, answers)), "host.example\r\n");
  EXPECT_EQ(answers, std::string_view("\xff\xfc\x01\xff\xfe\x03", 6));
  // An unfinished sequence waits for the rest.
  answers.clear();
  EXPECT_EQ(telnet_strip("\xff\xfd", answers), 0u);
  EXPECT_EQ(telnet_strip("\xff\xfd\x18x", answers), 3u);
  EXPECT_EQ(answers, "\xff\xfc\x18");
}

}  // namespace
}  // namespace velmor
