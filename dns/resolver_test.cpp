#include "dns/resolver.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <set>

#include "core/config.h"
#include "core/globals.h"
#include "core/network.h"
#include "core/test_fixture.h"
#include "dns/service.h"

namespace velmor::dns {
namespace {

using Bytes = std::vector<std::uint8_t>;

struct FakeTransport : Transport {
  struct Sent {
    SocketId socket;
    std::uint32_t server;
    Bytes packet;
  };
  std::vector<Sent> sent;
  std::set<SocketId> open_sockets;
  SocketId next = 0;
  SocketId open() override {
    open_sockets.insert(++next);
    return next;
  }
  int send(SocketId s, std::uint32_t server, std::span<const std::uint8_t> p) override {
    sent.push_back({s, server, Bytes(p.begin(), p.end())});
    return 0;
  }
  void close(SocketId s) override { open_sockets.erase(s); }
};

Bytes wire_name(std::string_view name) {
  Bytes out;
  while (!name.empty()) {
    std::size_t dot = name.find('.');
    std::string_view label = name.substr(0, dot);
    out.push_back(static_cast<std::uint8_t>(label.size()));
    out.insert(out.end(), label.begin(), label.end());
    name = dot == std::string_view::npos ? std::string_view() : name.substr(dot + 1);
  }
  out.push_back(0);
  return out;
}

struct Rr {
  std::string name;
  std::uint16_t type;
  std::uint32_t ttl;
  Bytes rdata;
};

// The answer to `query` (its identifier and question) with `answers`.
Bytes response(const Bytes& query, const std::vector<Rr>& answers) {
  Bytes m(query.begin(), query.end());
  m[2] = 0x81;
  m[3] = 0x80;
  m[7] = static_cast<std::uint8_t>(answers.size());
  for (const Rr& rr : answers) {
    Bytes n = wire_name(rr.name);
    m.insert(m.end(), n.begin(), n.end());
    const std::uint8_t fields[] = {0, static_cast<std::uint8_t>(rr.type), 0, 1,
                                   static_cast<std::uint8_t>(rr.ttl >> 24), static_cast<std::uint8_t>(rr.ttl >> 16),
                                   static_cast<std::uint8_t>(rr.ttl >> 8), static_cast<std::uint8_t>(rr.ttl),
                                   0, static_cast<std::uint8_t>(rr.rdata.size())};
    m.insert(m.end(), std::begin(fields), std::end(fields));
    m.insert(m.end(), rr.rdata.begin(), rr.rdata.end());
  }
  return m;
}

const std::uint32_t kServer1 = inet_addr("127.0.0.1");
const std::uint32_t kServer2 = inet_addr("127.0.0.2");

class ResolverTest : public ::testing::Test {
 protected:
  void SetUp() override {
    link_up = 1;
    link_probe_due = 0;
    status_bits = status::link_established;
    mail_transfer_state = 0;
    resolver.configure({{kServer1, kServer2}, 5, 2, ""});
    resolver.on_end([this](QueryId id, QueryState s) { ended.emplace_back(id, s); });
  }
  void TearDown() override { link_up = link_probe_due = 0; }
  void at(std::time_t t) {
    clock = t;
    resolver.poll();
  }
  void answer(const FakeTransport::Sent& s, const std::vector<Rr>& rrs) {
    resolver.receive(s.socket, s.server, 53, response(s.packet, rrs));
  }

  FakeTransport net;
  std::time_t clock = 1000;
  Resolver resolver{net, [this] { return clock; }};
  std::vector<std::pair<QueryId, QueryState>> ended;
};

TEST_F(ResolverTest, TriesEachServerInTurnThenTimesOutAndAsksForProbes) {
  QueryId q = resolver.client_start("www.example.org", 1, 1);
  ASSERT_EQ(resolver.state(q), QueryState::waiting);
  ASSERT_EQ(net.sent.size(), 1u);  // the first datagram leaves at once
  QueryId other = resolver.client_start("ftp.example.org", 1, 1);
  for (std::time_t t = 1001; t <= 1019; ++t) at(t);
  std::vector<std::uint32_t> servers;
  for (const auto& s : net.sent)
    if (s.socket == net.sent[0].socket) servers.push_back(s.server);
  EXPECT_EQ(servers, (std::vector<std::uint32_t>{kServer1, kServer2, kServer1, kServer2}));
  EXPECT_EQ(net.sent.size(), 8u);  // both lookups' due resends leave in the same pass
  resolver.client_discard(other);
  EXPECT_EQ(resolver.state(q), QueryState::waiting);
  EXPECT_EQ(link_probe_due, 0);
  at(1020);
  EXPECT_EQ(resolver.state(q), QueryState::failed);
  EXPECT_EQ(ended, (std::vector<std::pair<QueryId, QueryState>>{{q, QueryState::failed}}));
  EXPECT_EQ(link_probe_due, 1);
  EXPECT_FALSE(net.open_sockets.count(net.sent[0].socket));
}

TEST_F(ResolverTest, SixUnansweredProbesBreakTheLinkAndProbingStopsTwoMinutesLater) {
  resolver.configure({{kServer1, kServer2}, 30, 2, ""});
  QueryId waiting = resolver.client_start("slow.example.org", 1, 1);
  net.sent.clear();
  link_probe_due = 1;
  for (std::time_t t = 1001; t <= 1006; ++t) at(t);
  ASSERT_EQ(net.sent.size(), 6u);
  EXPECT_EQ(link_up, 1);
  at(1007);
  EXPECT_EQ(link_up, 0);
  EXPECT_EQ(status_bits, 0x80u | status::changed);
  EXPECT_EQ(resolver.state(waiting), QueryState::failed);  // losing the link fails what still waits
  net.sent.clear();
  for (std::time_t t = 1008; t <= 1140; ++t) at(t);
  EXPECT_EQ(net.sent.size(), 119u);  // once a second until 119 s after the break
  net.sent.clear();
  // A new lookup fails at once with the link down, but wants to know again.
  EXPECT_EQ(resolver.state(resolver.client_start("again.example.org", 1, 1)), QueryState::failed);
  at(1141);
  ASSERT_EQ(net.sent.size(), 1u);
  mail_transfer_state = 1;
  answer(net.sent[0], {});
  EXPECT_EQ(link_up, 1);
  EXPECT_TRUE(status_bits & status::link_established);
  EXPECT_EQ(mail_transfer_state, 5);
}

TEST_F(ResolverTest, CachedAnswersExpireWithTheirTtl) {
  QueryId q = resolver.client_start("WWW.example.org", 1, 1);
  answer(net.sent.at(0), {{"www.example.org", 5, 10, wire_name("web.example.org")},
                          {"web.example.org", 1, 100, {10, 0, 0, 7}},
                          {"web.example.org", 1, 0, {10, 0, 0, 8}}});
  ASSERT_EQ(resolver.state(q), QueryState::complete);
  EXPECT_EQ(resolver.client_ipaddr(q), inet_addr("10.0.0.7"));
  clock = 1009;
  QueryId again = resolver.client_start("www.EXAMPLE.org", 1, 1);
  EXPECT_EQ(resolver.state(again), QueryState::complete);
  EXPECT_EQ(resolver.client_ipaddr(again), inet_addr("10.0.0.7"));
  ASSERT_EQ(resolver.answers(again)->size(), 2u);  // the TTL-0 record served only its own lookup
  clock = 1010;  // the CNAME has expired
  EXPECT_EQ(resolver.state(resolver.client_start("www.example.org", 1, 1)), QueryState::waiting);
}

TEST_F(ResolverTest, MailExchangersComeBackByPreference) {
  QueryId q = resolver.client_start("example.org", 1, rrtype::mx);
  Bytes mx20 = {0, 20}, mx5 = {0, 5};
  Bytes b = wire_name("b.example.org"), a = wire_name("a.example.org");
  mx20.insert(mx20.end(), b.begin(), b.end());
  mx5.insert(mx5.end(), a.begin(), a.end());
  answer(net.sent.at(0), {{"example.org", 15, 60, mx20}, {"example.org", 15, 60, mx5}});
  auto hosts = resolver.client_mx(q);
  ASSERT_EQ(hosts.size(), 2u);
  EXPECT_EQ(hosts[0].preference, 5);
  EXPECT_EQ(hosts[0].host, "a.example.org");
}

// A mail route needs to know why: no such name, no records of the type,
// or no answer at all.
TEST_F(ResolverTest, AFailedLookupSaysWhy) {
  QueryId nx = resolver.client_start("gone.example", 1, rrtype::mx);
  Bytes reply = response(net.sent.at(0).packet, {});
  reply[3] |= 3;  // name error
  resolver.receive(net.sent.at(0).socket, net.sent.at(0).server, 53, reply);
  EXPECT_EQ(resolver.failure(nx), Failure::no_such_name);
  QueryId empty = resolver.client_start("plain.example", 1, rrtype::mx);
  answer(net.sent.at(1), {});
  EXPECT_EQ(resolver.failure(empty), Failure::no_records);
  QueryId silent = resolver.client_start("slow.example", 1, rrtype::mx);
  EXPECT_EQ(resolver.failure(silent), Failure::none);
  for (std::time_t t = 1001; t <= 1020; ++t) at(t);
  EXPECT_EQ(resolver.state(silent), QueryState::failed);
  EXPECT_EQ(resolver.failure(silent), Failure::no_answer);
}

TEST(DnsCache, KeepsTenThousandNamesDroppingTheLeastRecentlyUsed) {
  Cache cache;
  auto record = [](int i) { return Record{Section::answer, "n" + std::to_string(i), 1, 1, 60, 0, "abcd"}; };
  for (int i = 0; i < 10000; ++i) cache.store({record(i)}, 0);
  EXPECT_FALSE(cache.find("n0", 1).empty());  // used: n1 is now the oldest
  cache.store({record(10000)}, 1);
  EXPECT_EQ(cache.size(), 10000u);
  EXPECT_TRUE(cache.find("n1", 1).empty());
  EXPECT_FALSE(cache.find("n0", 1).empty());
  // A fresh answer replaces the name's records of that type.
  Record fresh = record(0);
  fresh.data = "wxyz";
  fresh.ttl = 7 * 86400;
  cache.store({fresh}, 1);
  auto kept = cache.find("n0", 1);
  ASSERT_EQ(kept.size(), 1u);
  EXPECT_EQ(kept[0].data, "wxyz");
  EXPECT_TRUE(cache.find("n0", 1 + 86400).empty());  // a TTL counts a day at most
}

// The binding to the loop: an outward connection waits in phase lookup for
// the resolver; closing it cancels its lookup then and there, and a lookup
// the cache answers at once still reaches it through the loop.
struct DnsService : SuiteTest {
  struct Idle : Session {
    void on_input(Connection&) override {}
  };
  void SetUp() override {
    SuiteTest::SetUp();
    config.dns_servers = "127.255.255.254";
    config.dns_timeout = 5;
    config.dns_retries = 2;
    dns_register();
    dns_start();
    link_up = 1;
  }
  void TearDown() override {
    dns_shutdown();
    SuiteTest::TearDown();
  }
};

TEST_F(DnsService, ClosingAConnectionCancelsItsLookupAtOnce) {
  Connection* c = connect_to(svc::smtp_client, "far.example.org", 25, std::make_unique<Idle>());
  ASSERT_NE(c, nullptr);
  EXPECT_EQ(c->phase(), Phase::lookup);
  EXPECT_EQ(dns_resolver().waiting(), 1u);
  c->close_now();
  EXPECT_EQ(dns_resolver().waiting(), 0u);
  EXPECT_EQ(connection_count(svc::smtp_client), 0);
}

TEST_F(DnsService, AnAnswerFromTheCacheReachesTheConnection) {
  LoopbackPeer server;
  dns_resolver().cache().store({Record{Section::answer, "cached.example", 1, 1, 60, 0, std::string("\x7f\0\0\x01", 4)}},
                               server_now);
  Connection* c = connect_to(svc::smtp_client, "cached.example", server.port, std::make_unique<Idle>());
  for (int i = 0; i < 100 && c->phase() != Phase::open; ++i) net_pass(10);
  EXPECT_EQ(c->phase(), Phase::open);
  EXPECT_EQ(c->peer().text, "127.0.0.1");
}

}  // namespace
}  // namespace velmor::dns
