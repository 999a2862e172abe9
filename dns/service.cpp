// Binds the resolver engine to the suite: real UDP sockets as records of
// service 100 in the dispatcher, the main-loop clock, the dns.* keys, the
// records that wait in state 80, and the control channel's "lookup".
#include "dns/service.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <map>
#include <memory>
#include <unordered_map>

#include "core/config.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/sockets.h"

namespace velmor {

namespace {

constexpr int kService = svc::dns | kDatagram;
constexpr std::size_t kMaxCallbackLookups = 4096;

// The resolver's token on each of its socket records.
struct DnsSocket : SessionData {
  explicit DnsSocket(dns::SocketId i) : id(i) {}
  dns::SocketId id;
};

class UdpTransport : public dns::Transport {
 public:
  bool ready = false;  // the dispatcher is up (open_sockets ran)

  dns::SocketId open() override {
    if (!ready) return 0;
    int fd = socket_datagram();
    if (fd < 0) return 0;
    SocketRecord* r = record_create(fd, kService, sockstate::initial);
    if (!r) {
      ::close(fd);
      return 0;
    }
    const dns::SocketId id = ++next_;
    r->session = std::make_unique<DnsSocket>(id);
    fds_[id] = fd;
    return id;
  }

  int send(dns::SocketId id, std::uint32_t server, std::span<const std::uint8_t> packet) override {
    auto it = fds_.find(id);
    if (it == fds_.end()) return EBADF;
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(53);
    to.sin_addr.s_addr = server;
    if (::sendto(it->second, packet.data(), packet.size(), MSG_DONTWAIT | MSG_NOSIGNAL,
                 reinterpret_cast<const sockaddr*>(&to), sizeof to) < 0)
      return errno;
    return 0;
  }

  void close(dns::SocketId id) override {
    auto it = fds_.find(id);
    if (it == fds_.end()) return;
    int fd = it->second;
    fds_.erase(it);
    SocketRecord* r = record_for(fd);
    if (r && r->session && r->session_as<DnsSocket>().id == id) socket_close(fd);
  }

  // The record went away without the resolver asking (shutdown).
  void forget(dns::SocketId id) { fds_.erase(id); }

 private:
  std::unordered_map<dns::SocketId, int> fds_;
  dns::SocketId next_ = 0;
};

// Which record a lookup belongs to: a reused descriptor carries another
// generation, so a late end never reaches it.
struct RecordKey {
  int fd = -1;
  std::uint32_t generation = 0;
  auto operator<=>(const RecordKey&) const = default;
};
RecordKey key_of(const SocketRecord& r) { return {r.fd, r.dispatch.generation}; }

struct Glue {
  UdpTransport transport;
  dns::Resolver resolver{transport, [] { return server_now; }};
  std::map<QueryId, RecordKey> owners;
  std::map<RecordKey, QueryId> by_record;
  std::unordered_map<QueryId, std::function<void(std::uint32_t)>> callbacks;
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

SocketRecord* owner_record(const RecordKey& key) {
  SocketRecord* r = record_for(key.fd);
  return r && !r->closed && r->dispatch.generation == key.generation ? r : nullptr;
}

void forget_owner(QueryId id) {
  auto& g = glue();
  auto it = g.owners.find(id);
  if (it == g.owners.end()) return;
  g.by_record.erase(it->second);
  g.owners.erase(it);
}

void lookup_ended(QueryId id, dns::QueryState state) {
  auto& g = glue();
  if (auto cb = g.callbacks.find(id); cb != g.callbacks.end()) {
    auto done = std::move(cb->second);
    g.callbacks.erase(cb);
    std::uint32_t address = state == dns::QueryState::complete ? g.resolver.client_ipaddr(id) : 0;
    g.resolver.client_discard(id);
    done(address);
    return;
  }
  auto owner = g.owners.find(id);
  if (owner == g.owners.end()) return;
  SocketRecord* r = owner_record(owner->second);
  if (!r) {
    forget_owner(id);
    g.resolver.client_discard(id);
    return;
  }
  if (r->state == sockstate::lookup) record_lookup_complete(*r, state == dns::QueryState::complete);
}

// Lookups whose record has closed are dropped.
void drop_orphans() {
  auto& g = glue();
  std::vector<QueryId> orphans;
  for (const auto& [id, key] : g.owners)
    if (!owner_record(key)) orphans.push_back(id);
  for (QueryId id : orphans) {
    forget_owner(id);
    g.resolver.client_discard(id);
  }
}

int dns_read(SocketRecord& record, long) {
  static std::array<std::uint8_t, 65536> buffer;
  auto& g = glue();
  const dns::SocketId id = record.session ? record.session_as<DnsSocket>().id : 0;
  for (int batch = 0; batch < 64 && !record.closed; ++batch) {
    sockaddr_in from{};
    socklen_t from_len = sizeof from;
    ssize_t n = ::recvfrom(record.fd, buffer.data(), buffer.size(), MSG_DONTWAIT | MSG_TRUNC,
                           reinterpret_cast<sockaddr*>(&from), &from_len);
    if (n < 0) break;
    if (from.sin_family != AF_INET) continue;
    std::size_t size = static_cast<std::size_t>(n);
    if (size > buffer.size()) {
      log_message("Datagram too large, dropped", {}, logfac::dns);
      continue;
    }
    g.resolver.receive(id, from.sin_addr.s_addr, ntohs(from.sin_port), std::span(buffer.data(), size));
  }
  return 0;
}

void dns_release(SocketRecord& record) {
  if (record.session) glue().transport.forget(record.session_as<DnsSocket>().id);
}

int dns_open_sockets() {
  glue().transport.ready = true;
  apply_settings();
  glue().resolver.poll();  // the first probe need not wait for a tick
  return 0;
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

void dns_init() {
  auto& g = glue();
  g.resolver.on_end(lookup_ended);
  apply_settings();
  register_service(kService, ServiceHandlers{.read = dns_read, .release = dns_release, .open_sockets = dns_open_sockets});
  hooks.lookup = control_lookup;
  hooks.link_probe_restart = [] { glue().resolver.restart_probing(); };
  hooks.link_hung_up = [] { glue().resolver.hung_up(); };
}

void dns_poll() {
  apply_settings();
  drop_orphans();
  glue().resolver.poll();
}

void dns_shutdown() {
  auto& g = glue();
  g.owners.clear();
  g.by_record.clear();
  g.callbacks.clear();
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
  forget_owner(id);
  glue().callbacks.erase(id);
  glue().resolver.client_discard(id);
}

bool record_lookup_start(SocketRecord& record, std::string_view name, int qclass, int qtype) {
  auto& g = glue();
  record_lookup_discard(record);
  QueryId id = client_start(name, qclass, qtype);
  if (id == 0) return false;
  const RecordKey key = key_of(record);
  g.owners[id] = key;
  g.by_record[key] = id;
  record.state = sockstate::lookup;
  dns::QueryState state = g.resolver.state(id);
  if (state == dns::QueryState::complete || state == dns::QueryState::failed)
    record_lookup_complete(record, state == dns::QueryState::complete);
  return true;
}

QueryId record_lookup(const SocketRecord& record) {
  auto& g = glue();
  auto it = g.by_record.find(key_of(record));
  return it == g.by_record.end() ? 0 : it->second;
}

void record_lookup_discard(SocketRecord& record) {
  if (QueryId id = record_lookup(record)) client_discard(id);
}

void dns_lookup(std::string_view name, std::function<void(std::uint32_t address)> done) {
  auto& g = glue();
  QueryId id = g.callbacks.size() < kMaxCallbackLookups ? client_start(name, 1, 1) : 0;
  dns::QueryState state = id ? g.resolver.state(id) : dns::QueryState::failed;
  if (state == dns::QueryState::waiting) {
    g.callbacks[id] = std::move(done);
    return;
  }
  std::uint32_t address = state == dns::QueryState::complete ? g.resolver.client_ipaddr(id) : 0;
  if (id) g.resolver.client_discard(id);
  done(address);
}

}  // namespace velmor
