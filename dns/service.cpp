// Binds the resolver engine to the suite: real UDP sockets watched by the
// loop, the main-loop clock, the dns.* keys, the lookups of outward
// connections and the control channel's "lookup".
#include "dns/service.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <unordered_map>

#include "core/config.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/network.h"

namespace velmor {

namespace {

constexpr std::size_t kMaxCallbackLookups = 4096;

void dns_read(dns::SocketId id, int fd);

class UdpTransport : public dns::Transport {
 public:
  bool ready = false;  // the loop is up (dns_start ran)

  dns::SocketId open() override {
    if (!ready) return 0;
    UniqueFd fd(::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
    if (!fd) {
      log_write(std::string("Socket create failed: ") + std::strerror(errno), logchan::errors);
      return 0;
    }
    const dns::SocketId id = ++next_;
    const int raw = fd.get();
    if (!watch_readable(raw, [id, raw] { dns_read(id, raw); })) return 0;
    fds_[id] = std::move(fd);
    return id;
  }

  int send(dns::SocketId id, std::uint32_t server, std::span<const std::uint8_t> packet) override {
    auto it = fds_.find(id);
    if (it == fds_.end()) return EBADF;
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(53);
    to.sin_addr.s_addr = server;
    if (::sendto(it->second.get(), packet.data(), packet.size(), MSG_DONTWAIT | MSG_NOSIGNAL,
                 reinterpret_cast<const sockaddr*>(&to), sizeof to) < 0)
      return errno;
    return 0;
  }

  void close(dns::SocketId id) override {
    auto it = fds_.find(id);
    if (it == fds_.end()) return;
    unwatch(it->second.get());
    fds_.erase(it);  // closes the descriptor
  }

  bool has(dns::SocketId id) const { return fds_.contains(id); }

 private:
  std::unordered_map<dns::SocketId, UniqueFd> fds_;
  dns::SocketId next_ = 0;
};

struct Glue {
  UdpTransport transport;
  dns::Resolver resolver{transport, [] { return server_now; }};
  std::unordered_map<QueryId, std::function<void(std::uint32_t)>> callbacks;
  std::unordered_map<QueryId, std::function<void(MxAnswer)>> mx_callbacks;
  std::array<std::uint8_t, 65536> buffer{};
  // The key texts last applied, so a "reload config" is noticed.
  std::string servers_text, search_text;
  int timeout = -1, retries = -1;
};
Glue& glue() {
  static Glue g;
  return g;
}

void apply_settings() {
  auto& g = glue();
  const std::string& servers = text_of(config.dns_servers);
  const std::string& search = text_of(config.dns_search);
  if (servers == g.servers_text && search == g.search_text && config.dns_timeout == g.timeout &&
      config.dns_retries == g.retries)
    return;
  g.servers_text = servers;
  g.search_text = search;
  g.timeout = config.dns_timeout;
  g.retries = config.dns_retries;
  dns::Settings s;
  s.servers = dns::parse_servers(servers);
  s.timeout = config.dns_timeout;
  s.retries = config.dns_retries;
  std::string_view domain = search;
  while (!domain.empty() && (domain.front() == '.' || domain.front() == ' ')) domain.remove_prefix(1);
  while (!domain.empty() && (domain.back() == '.' || domain.back() == ' ')) domain.remove_suffix(1);
  s.search = std::string(domain);
  g.resolver.configure(std::move(s));
}

MxAnswer mx_answer(QueryId id) {
  auto& r = glue().resolver;
  MxAnswer a;
  if (r.state(id) == dns::QueryState::complete) {
    for (dns::MxHost& h : r.client_mx(id)) a.hosts.push_back(std::move(h.host));
    a.result = a.hosts.empty() ? MxResult::none : MxResult::found;
    return a;
  }
  switch (r.failure(id)) {
    case dns::Failure::no_such_name: a.result = MxResult::no_such_domain; break;
    case dns::Failure::no_records: a.result = MxResult::none; break;
    default: a.result = MxResult::failed; break;
  }
  return a;
}

void lookup_ended(QueryId id, dns::QueryState state) {
  auto& g = glue();
  if (auto mx = g.mx_callbacks.find(id); mx != g.mx_callbacks.end()) {
    auto done = std::move(mx->second);
    g.mx_callbacks.erase(mx);
    MxAnswer answer = mx_answer(id);
    g.resolver.client_discard(id);
    done(std::move(answer));
    return;
  }
  auto cb = g.callbacks.find(id);
  if (cb == g.callbacks.end()) return;
  auto done = std::move(cb->second);
  g.callbacks.erase(cb);
  std::uint32_t address = state == dns::QueryState::complete ? g.resolver.client_ipaddr(id) : 0;
  g.resolver.client_discard(id);
  done(address);
}

void dns_read(dns::SocketId id, int fd) {
  auto& g = glue();
  // The answer may end the lookup and close this very socket.
  for (int batch = 0; batch < 64 && g.transport.has(id); ++batch) {
    sockaddr_in from{};
    socklen_t from_len = sizeof from;
    ssize_t n = ::recvfrom(fd, g.buffer.data(), g.buffer.size(), MSG_DONTWAIT | MSG_TRUNC,
                           reinterpret_cast<sockaddr*>(&from), &from_len);
    if (n < 0) break;
    if (from.sin_family != AF_INET) continue;
    std::size_t size = static_cast<std::size_t>(n);
    if (size > g.buffer.size()) {
      log_message("Datagram too large, dropped", {}, logfac::dns);
      continue;
    }
    g.resolver.receive(id, from.sin_addr.s_addr, ntohs(from.sin_port), std::span(g.buffer.data(), size));
  }
}

void control_lookup(std::string_view name, std::function<void(std::string_view)> done) {
  dns_lookup(name, [done = std::move(done)](std::uint32_t address) {
    if (address == 0) {
      done({});
      return;
    }
    in_addr a{};
    a.s_addr = address;
    char text[INET_ADDRSTRLEN] = {};
    done(inet_ntop(AF_INET, &a, text, sizeof text) ? text : "");
  });
}

}  // namespace

void dns_register() {
  auto& g = glue();
  g.resolver.on_end(lookup_ended);
  apply_settings();
  net_set_resolver({.start = [](std::string_view name, std::function<void(std::uint32_t)> done) {
                      return dns_lookup(name, std::move(done));
                    },
                    .cancel = client_discard,
                    .mail_exchangers = dns_mail_exchangers});
  hooks.lookup = control_lookup;
  hooks.link_probe_restart = [] { glue().resolver.restart_probing(); };
  hooks.link_hung_up = [] { glue().resolver.hung_up(); };
}

void dns_start() {
  glue().transport.ready = true;
  apply_settings();
  glue().resolver.poll();  // the first probe need not wait for a tick
}

void dns_poll() {
  apply_settings();
  glue().resolver.poll();
}

void dns_shutdown() {
  auto& g = glue();
  g.callbacks.clear();
  g.mx_callbacks.clear();
  g.resolver.clear();
  g.transport.ready = false;
}

dns::Resolver& dns_resolver() { return glue().resolver; }

QueryId client_start(std::string_view name, int qclass, int qtype) {
  apply_settings();
  return glue().resolver.client_start(name, qclass, qtype);
}
dns::QueryState query_state(QueryId id) { return glue().resolver.state(id); }
std::uint32_t client_ipaddr(QueryId id) { return glue().resolver.client_ipaddr(id); }
std::vector<dns::MxHost> client_mx(QueryId id) { return glue().resolver.client_mx(id); }
void client_discard(QueryId id) {
  glue().callbacks.erase(id);
  glue().mx_callbacks.erase(id);
  glue().resolver.client_discard(id);
}

QueryId dns_lookup(std::string_view name, std::function<void(std::uint32_t address)> done) {
  auto& g = glue();
  QueryId id = g.callbacks.size() < kMaxCallbackLookups ? client_start(name, 1, 1) : 0;
  dns::QueryState state = id ? g.resolver.state(id) : dns::QueryState::failed;
  if (state == dns::QueryState::waiting) {
    g.callbacks[id] = std::move(done);
    return id;
  }
  std::uint32_t address = state == dns::QueryState::complete ? g.resolver.client_ipaddr(id) : 0;
  if (id) g.resolver.client_discard(id);
  done(address);
  return 0;
}

QueryId dns_mail_exchangers(std::string_view domain, std::function<void(MxAnswer)> done) {
  auto& g = glue();
  QueryId id = g.callbacks.size() + g.mx_callbacks.size() < kMaxCallbackLookups ? client_start(domain, 1, 15) : 0;
  if (id && g.resolver.state(id) == dns::QueryState::waiting) {
    g.mx_callbacks[id] = std::move(done);
    return id;
  }
  MxAnswer answer = id ? mx_answer(id) : MxAnswer{};
  if (id) g.resolver.client_discard(id);
  done(std::move(answer));
  return 0;
}

}  // namespace velmor
