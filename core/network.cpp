// The event loop (level-triggered epoll) and the services on it.
//
// Every descriptor the loop watches has a slot: a connection (listeners
// included) or a raw descriptor with its "readable" callback. Interest
// follows each connection's needs after every turn it gets: listeners read
// while their service is under its connection limit, connections read
// while their input has room and write while output is queued, so an idle
// suite sleeps in epoll_wait until its next timer or tick.
#include "core/network.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <exception>
#include <map>
#include <queue>
#include <unordered_map>
#include <unordered_set>
#include <utility>
#include <vector>

#include "core/connection_core.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/privileges.h"
#include "core/strfmt.h"
#include "core/tls.h"

namespace velmor {

namespace {

constexpr int kAcceptBatch = 128;  // per readiness event, so others are served too
constexpr int kTouchRounds = 8;

std::int64_t monotonic_ms() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

void serious(const std::string& text, int flags = 0) { log_write(text, logchan::errors, flags); }
std::string sys_error() { return std::strerror(errno); }

// Runs a hook or a raw descriptor's callback; an exception is logged and
// the loop goes on.
template <class F>
void guarded(const char* what, F&& f) {
  try {
    f();
  } catch (const std::exception& e) {
    serious(strprintf("The %s failed: %s", what, e.what()), kLogUnbuffered);
  } catch (...) {
    serious(strprintf("The %s failed", what), kLogUnbuffered);
  }
}

struct Slot {
  std::uint32_t generation = 0;  // tells a reused descriptor from its predecessor
  std::uint64_t connection = 0;  // the connection on it, or 0 ...
  std::function<void()> ready;   // ... a raw descriptor's callback
  std::function<void()> writable;  // and its one writable wait
  bool watched = false;
  std::uint32_t events = 0;
};

// What the loop keeps about each connection besides the object.
struct Entry {
  std::unique_ptr<Connection> connection;
  bool counted = false;       // in its service's count
  bool accepted = false;      // made by accept: the session limit applies
  bool peer_counted = false;  // in its peer's share
  std::time_t accept_paused_until = 0;  // listeners: out of descriptors
};

class Network final : public ConnectionHost {
 public:
  int epoll_fd = -1;
  std::vector<Slot> slots;  // by descriptor
  std::unordered_map<std::uint64_t, Entry> entries;
  std::vector<std::unique_ptr<Connection>> released;  // freed after the pass
  std::vector<ServiceDescriptor> services;            // in registration order
  std::map<int, int> counts;
  std::map<std::pair<int, std::uint32_t>, int> peers;  // connections per (service, peer)
  std::unordered_set<std::uint64_t> touched;
  std::vector<std::uint64_t> yielded;  // served again at the next pass
  std::priority_queue<std::pair<std::int64_t, std::uint64_t>, std::vector<std::pair<std::int64_t, std::uint64_t>>,
                      std::greater<>>
      timers;
  std::vector<std::function<void()>> pass_hooks, tick_hooks;
  NameResolver resolver;
  std::vector<std::pair<std::uint64_t, std::uint32_t>> lookups_done;
  std::uint64_t last_id = 0;
  std::uint32_t generation = 0;
  std::uint64_t accepted = 0;
  std::time_t share_logged = 0;
  std::vector<epoll_event> events = std::vector<epoll_event>(256);

  // ConnectionHost
  void touch(Connection& c) override { touched.insert(c.id()); }
  void next_pass(Connection& c) override { yielded.push_back(c.id()); }
  void timer_changed(Connection& c, std::int64_t due) override {
    if (due) timers.emplace(due, c.id());
  }
  void release(Connection& c) override;
  std::int64_t now_ms() const override { return monotonic_ms(); }

  bool ensure_epoll();
  Slot* slot(int fd) {
    return fd >= 0 && static_cast<std::size_t>(fd) < slots.size() ? &slots[static_cast<std::size_t>(fd)] : nullptr;
  }
  Slot& claim(int fd) {
    if (static_cast<std::size_t>(fd) >= slots.size()) slots.resize(static_cast<std::size_t>(fd) + 64);
    Slot& s = slots[static_cast<std::size_t>(fd)];
    s = Slot{};
    s.generation = ++generation;
    return s;
  }
  bool set_events(int fd, Slot& s, std::uint32_t ev);
  // Forgets a raw descriptor's slot (out of the epoll set too).
  void drop_raw(int fd) {
    Slot* s = slot(fd);
    if (!s || s->connection) return;
    if (s->watched) epoll_ctl(epoll_fd, EPOLL_CTL_DEL, fd, nullptr);
    *s = Slot{};
  }
  void sync(Connection& c);
  Connection& add(std::unique_ptr<Connection> c, int fd, bool counted);
  const ServiceDescriptor* service(int number) const {
    for (const auto& s : services)
      if (s.number == number) return &s;
    return nullptr;
  }
  int limit(int number) const {
    const ServiceDescriptor* s = service(number);
    return s && s->max ? *s->max : -1;
  }
  bool peer_may_connect(int number, std::uint32_t peer);
  void accept_batch(Connection& listener);
  void connect_step(Connection& c);
  void start_connect(Connection& c, std::uint32_t address);
  void settle_lookups();
  int run_timers();
  void serve_touched();
};

Network& net() {
  static Network n;
  return n;
}

bool Network::ensure_epoll() {
  if (epoll_fd >= 0) return true;
  epoll_fd = epoll_create1(EPOLL_CLOEXEC);
  if (epoll_fd < 0) {
    serious("epoll create failed: " + sys_error(), kLogUnbuffered);
    return false;
  }
  return true;
}

bool Network::set_events(int fd, Slot& s, std::uint32_t ev) {
  if (s.watched && s.events == ev) return true;
  epoll_event e{};
  e.events = ev;
  e.data.u64 = (static_cast<std::uint64_t>(s.generation) << 32) | static_cast<std::uint32_t>(fd);
  if (epoll_ctl(epoll_fd, s.watched ? EPOLL_CTL_MOD : EPOLL_CTL_ADD, fd, &e) != 0) return false;
  s.watched = true;
  s.events = ev;
  return true;
}

// Brings a connection's registration in line with what it waits for.
void Network::sync(Connection& c) {
  const int fd = ConnectionCore::fd(c);
  Slot* s = slot(fd);
  if (c.closed() || !s || s->connection != c.id()) return;
  std::uint32_t ev = 0;
  if (c.phase() == Phase::listening) {
    const Entry& e = entries[c.id()];
    int max = limit(c.service());
    if (e.accept_paused_until <= server_now && (max < 0 || connection_count(c.service()) < max)) ev = EPOLLIN;
  } else {
    if (ConnectionCore::wants_read(c)) ev |= EPOLLIN;
    if (ConnectionCore::wants_write(c)) ev |= EPOLLOUT;
  }
  set_events(fd, *s, ev);
}

Connection& Network::add(std::unique_ptr<Connection> c, int fd, bool counted) {
  Connection& ref = *c;
  Entry& e = entries[c->id()];
  e.connection = std::move(c);
  e.counted = counted;
  if (counted) ++counts[ref.service()];
  if (fd >= 0) {
    Slot& s = claim(fd);
    s.connection = ref.id();
  }
  return ref;
}

void Network::release(Connection& c) {
  auto it = entries.find(c.id());
  if (it == entries.end()) return;
  const int fd = ConnectionCore::fd(c);
  if (Slot* s = slot(fd); s && s->connection == c.id()) {
    if (s->watched) epoll_ctl(epoll_fd, EPOLL_CTL_DEL, fd, nullptr);
    *s = Slot{};
  }
  if (std::uint64_t handle = ConnectionCore::lookup(c)) {
    ConnectionCore::set_lookup(c, 0);
    if (resolver.cancel) guarded("lookup cancel", [&] { resolver.cancel(handle); });
  }
  Entry& e = it->second;
  if (e.counted) {
    int& n = counts[c.service()];
    if (n > 0) --n;
  }
  if (e.peer_counted) {
    auto p = peers.find({c.service(), c.peer().ip});
    if (p != peers.end() && --p->second <= 0) peers.erase(p);
  }
  released.push_back(std::move(e.connection));
  entries.erase(it);
  touched.erase(c.id());
}

bool Network::peer_may_connect(int number, std::uint32_t peer) {
  if ((ntohl(peer) >> 24) == 127) return true;  // loopback: this machine's own programs
  int max = limit(number);
  if (max < 0) return true;
  auto it = peers.find({number, peer});
  return it == peers.end() || it->second < std::max(1, max / 4);
}

void Network::accept_batch(Connection& listener) {
  progress_code = 140400;
  const int number = listener.service();
  const ServiceDescriptor* desc = service(number);
  const int listen_fd = ConnectionCore::fd(listener);
  for (int i = 0; i < kAcceptBatch && desc; ++i) {
    int max = limit(number);
    if (max >= 0 && connection_count(number) >= max) return;  // the rest wait in the backlog
    if (log_mask & logfac::proxy) log_message("Accept request (service):", std::to_string(number), logfac::proxy);
    sockaddr_in peer{};
    socklen_t len = sizeof peer;
    int fd = accept4(listen_fd, reinterpret_cast<sockaddr*>(&peer), &len, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        // Out of descriptors: leave the backlog alone for a second rather
        // than spin on a listener that stays readable.
        serious("Accept failed: " + sys_error());
        entries[listener.id()].accept_paused_until = server_now + 1;
      }
      return;
    }
    Peer who;
    if (peer.sin_family == AF_INET) {
      who.ip = peer.sin_addr.s_addr;
      who.port = ntohs(peer.sin_port);
      who.text = dotted(who.ip);
    } else {
      who.text = "unknown";
    }
    if (log_mask & logfac::proxy) log_message("Accepted:", who.text, logfac::proxy);
    if (!peer_may_connect(number, who.ip)) {
      if (share_logged != server_now) {  // at most a line a second, however hard a peer tries
        share_logged = server_now;
        log_message(strprintf("Service %d: connection refused, too many from ", number), who.text);
      }
      ::close(fd);
      continue;
    }
    std::unique_ptr<Transport> transport;
    if (desc->implicit_tls) {
      transport = tls_transport(UniqueFd(fd), TlsPlan{});
      if (!transport) {  // no certificate: nothing to speak here
        tls_note_failure(who.text, number, "TLS is off (no certificate loaded)");
        continue;  // the descriptor closed with the failed attempt
      }
    } else {
      transport = std::make_unique<PlainTransport>(UniqueFd(fd));
    }
    auto made = ConnectionCore::make(*this, ++last_id, number, static_cast<std::size_t>(socket_buffer_size()));
    ConnectionCore::set_transport(*made, std::move(transport), fd);
    ConnectionCore::set_peer(*made, who);
    Connection& c = add(std::move(made), fd, true);
    Entry& e = entries[c.id()];
    e.accepted = true;
    if (who.ip) {
      ++peers[{number, who.ip}];
      e.peer_counted = true;
    }
    ++accepted;
    start_accepted(c, *desc);
    sync(c);
  }
}

// An outward connection became writable (or failed).
void Network::connect_step(Connection& c) {
  int error = 0;
  socklen_t len = sizeof error;
  if (getsockopt(ConnectionCore::fd(c), SOL_SOCKET, SO_ERROR, &error, &len) != 0) error = errno;
  if (error == EINPROGRESS || error == EALREADY) return;
  if (error != 0) {
    c.close_now(CloseReason::connect_failed);
    return;
  }
  ConnectionCore::open(c);
}

void Network::start_connect(Connection& c, std::uint32_t address) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    serious("Socket create failed: " + sys_error());
    c.close_now(CloseReason::connect_failed);
    return;
  }
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_port = htons(ConnectionCore::target_port(c));
  to.sin_addr.s_addr = address;
  int rc = ::connect(fd, reinterpret_cast<sockaddr*>(&to), sizeof to);
  if (rc != 0 && errno != EINPROGRESS) {
    ::close(fd);
    c.close_now(CloseReason::connect_failed);
    return;
  }
  ConnectionCore::set_peer(c, Peer{address, ConnectionCore::target_port(c), dotted(address)});
  ConnectionCore::set_transport(c, std::make_unique<PlainTransport>(UniqueFd(fd)), fd);
  Slot& s = claim(fd);
  s.connection = c.id();
  ConnectionCore::set_phase(c, Phase::connecting);
  if (rc == 0) ConnectionCore::open(c);
  sync(c);
}

// Lookups that ended since the last look: their connections move on.
void Network::settle_lookups() {
  while (!lookups_done.empty()) {
    auto done = std::move(lookups_done);
    lookups_done.clear();
    for (auto [id, address] : done) {
      auto it = entries.find(id);
      if (it == entries.end()) continue;
      Connection& c = *it->second.connection;
      if (c.phase() != Phase::lookup) continue;
      ConnectionCore::set_lookup(c, 0);
      if (address == 0) {
        c.close_now(CloseReason::lookup_failed);
      } else {
        start_connect(c, address);
      }
    }
  }
}

// Fires the timers that are due; the milliseconds until the next (-1 none).
int Network::run_timers() {
  const std::int64_t now = monotonic_ms();
  while (!timers.empty()) {
    auto [due, id] = timers.top();
    if (due > now) return static_cast<int>(due - now);
    timers.pop();
    auto it = entries.find(id);
    if (it == entries.end()) continue;
    Connection& c = *it->second.connection;
    if (ConnectionCore::wake_due(c) != due) continue;  // replaced or cancelled
    ConnectionCore::fire_timer(c);
    sync(c);
  }
  return -1;
}

void Network::serve_touched() {
  for (int round = 0; round < kTouchRounds && !touched.empty(); ++round) {
    std::vector<std::uint64_t> ids(touched.begin(), touched.end());
    touched.clear();
    for (std::uint64_t id : ids) {
      auto it = entries.find(id);
      if (it == entries.end()) continue;
      Connection& c = *it->second.connection;
      if (c.phase() != Phase::listening && c.phase() != Phase::lookup && c.phase() != Phase::connecting)
        ConnectionCore::serve(c, false);
      sync(c);
    }
  }
}

}  // namespace

// ---- services -------------------------------------------------------------------

void service_register(ServiceDescriptor service) {
  auto& n = net();
  for (auto& s : n.services) {
    if (s.number == service.number) {
      s = std::move(service);
      return;
    }
  }
  n.services.push_back(std::move(service));
}

const ServiceDescriptor* service_find(int number) { return net().service(number); }

std::vector<const ServiceDescriptor*> service_list() {
  std::vector<const ServiceDescriptor*> out;
  for (const auto& s : net().services) out.push_back(&s);
  return out;
}

Admission service_admit(const ServiceDescriptor& service, std::uint32_t peer_nbo) {
  progress_code = 140500;
  if (service.allow && address_list_match(*service.allow, peer_nbo)) return Admission::accepted;
  if (service.block && address_list_match(*service.block, peer_nbo)) return Admission::refused;
  if (service.auth && address_list_match(*service.auth, peer_nbo)) return Admission::identify;
  return Admission::accepted;
}

void start_accepted(Connection& c, const ServiceDescriptor& service) {
  ConnectionCore::set_paced_by_lines(c, service.paced_by_lines);
  c.set_line_limit(service.line_limit);
  c.set_line_ends(service.line_ends);
  c.set_idle_timeout(service.timeout ? *service.timeout : 0);
  c.set_session_limit(config.sock_session_max);
  if (hooks.default_group) c.set_group(hooks.default_group());
  const Admission admission = service_admit(service, c.peer().ip);
  std::unique_ptr<Session> session;
  if (admission != Admission::refused && service.make_session) {
    try {
      session = service.make_session(c, admission);
    } catch (const std::exception& e) {
      serious(strprintf("Service %d: the session could not be made: %s", service.number, e.what()), kLogUnbuffered);
    }
  }
  if (!session) {
    // Refused: told so (when the service has words for it), then closed.
    if (admission == Admission::refused && service.refusal) c.send(service.refusal());
    c.close_after_send();
    ConnectionCore::serve(c, false);
    return;
  }
  ConnectionCore::set_session(c, std::move(session));
  ConnectionCore::open(c);
}

// ---- start-up and shutdown -----------------------------------------------------------

int net_listen(int service, int port, std::string* error) {
  auto& n = net();
  auto why = [&](std::string text) {
    if (error) *error = std::move(text);
    return -1;
  };
  if (!n.ensure_epoll()) return why("no event poll");
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    std::string reason = sys_error();
    std::string msg = strprintf("TCP Socket create for port:%d failed: %s", port, reason.c_str());
    serious(msg);
    log_message(msg);
    return why(reason);
  }
  int one = 1;
  setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
  sockaddr_in a{};
  a.sin_family = AF_INET;
  a.sin_port = htons(static_cast<std::uint16_t>(port));
  a.sin_addr.s_addr = htonl(INADDR_ANY);
  auto fail = [&](const std::string& msg, std::string reason) {
    serious(msg, kLogUnbuffered);
    log_message(msg);
    ::close(fd);
    return why(std::move(reason));
  };
  if (!paths.bind_address.empty() && inet_pton(AF_INET, paths.bind_address.c_str(), &a.sin_addr) != 1)
    return fail("Bind address not understood: " + paths.bind_address, "the address is not understood");
  int bound;
  {
    BindingPrivileges root;  // the only step that may need root
    bound = ::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
  }
  if (bound != 0) {
    std::string reason = sys_error();
    return fail(strprintf("Bind Failed - is another server running on this port: %d", port), reason);
  }
  if (::listen(fd, 128) != 0) {
    std::string reason = sys_error();
    return fail(strprintf("Listen failed on port %d: %s", port, reason.c_str()), reason);
  }
  socklen_t len = sizeof a;
  getsockname(fd, reinterpret_cast<sockaddr*>(&a), &len);
  auto made = ConnectionCore::make(n, ++n.last_id, service, 0);
  ConnectionCore::set_transport(*made, std::make_unique<PlainTransport>(UniqueFd(fd)), fd);
  ConnectionCore::set_phase(*made, Phase::listening);
  Connection& c = n.add(std::move(made), fd, false);
  n.sync(c);
  return ntohs(a.sin_port);
}

int net_start(std::vector<ListenReport>* report) {
  auto& n = net();
  if (!n.ensure_epoll()) return 1;
  // Serving many clients needs many descriptors: take what the system allows.
  rlimit lim{};
  if (getrlimit(RLIMIT_NOFILE, &lim) == 0 && lim.rlim_cur < lim.rlim_max) {
    lim.rlim_cur = lim.rlim_max == RLIM_INFINITY ? 65536 : lim.rlim_max;
    setrlimit(RLIMIT_NOFILE, &lim);
  }
  std::vector<ListenReport> wanted;  // copied: opening touches nothing of the list
  std::vector<int> numbers;
  for (const auto& s : n.services) {
    if (!s.port) continue;
    wanted.push_back({.service = s.name,
                      .address = paths.bind_address.empty() ? "0.0.0.0" : paths.bind_address,
                      .port = *s.port,
                      .enabled = !s.enabled || *s.enabled,
                      .error = {}});
    numbers.push_back(s.number);
  }
  int rc = 0;
  for (std::size_t i = 0; i < wanted.size(); ++i) {
    if (wanted[i].enabled && net_listen(numbers[i], wanted[i].port, &wanted[i].error) < 0) {
      if (wanted[i].error.empty()) wanted[i].error = "failed";
      rc = 1;
    }
  }
  if (report) *report = std::move(wanted);
  return rc;
}

void net_close_all() {
  auto& n = net();
  std::vector<std::uint64_t> ids;
  for (const auto& [id, e] : n.entries) ids.push_back(id);
  for (std::uint64_t id : ids) {
    auto it = n.entries.find(id);
    if (it != n.entries.end()) it->second.connection->close_now(CloseReason::shutdown);
  }
  for (std::size_t fd = 0; fd < n.slots.size(); ++fd)
    if (n.slots[fd].ready || n.slots[fd].writable) unwatch(static_cast<int>(fd));
  n.released.clear();
}

void net_reset() {
  auto& n = net();
  net_close_all();
  n.services.clear();
  n.pass_hooks.clear();
  n.tick_hooks.clear();
  n.resolver = {};
  n.touched.clear();
  n.yielded.clear();
  n.timers = {};
  n.lookups_done.clear();
  n.counts.clear();
  n.peers.clear();
}

// ---- the loop --------------------------------------------------------------------------

void net_pass(int timeout_ms) {
  auto& n = net();
  n.released.clear();
  if (!n.ensure_epoll()) return;
  progress_code = 140100;
  n.settle_lookups();
  const int timer_ms = n.run_timers();
  for (std::uint64_t id : std::exchange(n.yielded, {})) {
    auto it = n.entries.find(id);
    if (it == n.entries.end()) continue;
    ConnectionCore::resume_turn(*it->second.connection);
    n.touched.insert(id);
  }
  n.serve_touched();
  for (auto& [id, e] : n.entries)
    if (e.connection->phase() == Phase::listening) n.sync(*e.connection);
  if (!n.touched.empty() || !n.lookups_done.empty()) timeout_ms = 0;
  if (timer_ms >= 0 && (timeout_ms < 0 || timer_ms < timeout_ms)) timeout_ms = timer_ms;
  int count = epoll_wait(n.epoll_fd, n.events.data(), static_cast<int>(n.events.size()), timeout_ms);
  for (int i = 0; i < count; ++i) {
    const epoll_event ev = n.events[static_cast<std::size_t>(i)];
    const int fd = static_cast<int>(ev.data.u64 & 0xffffffffu);
    Slot* s = n.slot(fd);
    // A descriptor closed earlier in this pass may already serve another.
    if (!s || s->generation != static_cast<std::uint32_t>(ev.data.u64 >> 32)) continue;
    if (s->ready || s->writable) {
      progress_code = 140106;
      const std::uint32_t generation = s->generation;
      if (s->writable && (ev.events & (EPOLLOUT | EPOLLERR | EPOLLHUP))) {
        auto writable = std::move(s->writable);  // one wait, one call
        s->writable = nullptr;
        n.set_events(fd, *s, s->ready ? std::uint32_t{EPOLLIN} : 0u);
        guarded("descriptor handler", writable);
        s = n.slot(fd);  // the callback may have unwatched or reused it
        if (!s || s->generation != generation) continue;
        if (!s->ready && !s->writable) {
          n.drop_raw(fd);  // nothing waits on it any more
          continue;
        }
      }
      if (s->ready && (ev.events & (EPOLLIN | EPOLLERR | EPOLLHUP))) {
        auto ready = s->ready;  // the callback may unwatch its own descriptor
        guarded("descriptor handler", ready);
      }
      continue;
    }
    auto it = n.entries.find(s->connection);
    if (it == n.entries.end()) continue;
    Connection& c = *it->second.connection;
    progress_code = 140104;
    switch (c.phase()) {
      case Phase::listening:
        n.accept_batch(c);
        break;
      case Phase::connecting:
        n.connect_step(c);
        break;
      case Phase::lookup:
        break;
      default: {
        ConnectionCore::serve(c, (ev.events & (EPOLLIN | EPOLLHUP | EPOLLERR)) != 0);
        // Gone without a word: nothing more can be read or sent.
        if (!c.closed() && ((ev.events & EPOLLERR) ||
                            ((ev.events & EPOLLHUP) && !ConnectionCore::wants_read(c))))
          c.close_now(CloseReason::peer_reset);
        break;
      }
    }
    n.sync(c);
  }
  if (count == static_cast<int>(n.events.size())) n.events.resize(n.events.size() * 2);
  n.settle_lookups();
  run_after_pass();
  n.serve_touched();
  progress_code = 140110;
}

void run_after_pass() {
  auto& n = net();
  for (std::size_t i = 0; i < n.pass_hooks.size(); ++i) {
    auto hook = n.pass_hooks[i];
    guarded("after-pass hook", hook);
  }
}

void net_tick() {
  auto& n = net();
  std::vector<std::uint64_t> ids;
  for (const auto& [id, e] : n.entries) {
    const Connection& c = *e.connection;
    if (c.phase() == Phase::listening) continue;
    const bool idle = c.idle_timeout() > 0 && server_now - c.last_active() > c.idle_timeout();
    const bool too_long = e.accepted && c.session_limit() > 0 && server_now - c.created() > c.session_limit();
    if (idle || too_long) ids.push_back(id);
  }
  for (std::uint64_t id : ids) {
    auto it = n.entries.find(id);
    if (it == n.entries.end()) continue;
    Connection& c = *it->second.connection;
    const bool idle = c.idle_timeout() > 0 && server_now - c.last_active() > c.idle_timeout();
    c.close_now(idle ? CloseReason::timed_out : CloseReason::session_limit);
  }
  for (std::size_t i = 0; i < n.tick_hooks.size(); ++i) {
    auto hook = n.tick_hooks[i];
    guarded("tick hook", hook);
  }
}

void after_pass(std::function<void()> hook) { net().pass_hooks.push_back(std::move(hook)); }
void every_tick(std::function<void()> hook) { net().tick_hooks.push_back(std::move(hook)); }

bool watch_readable(int fd, std::function<void()> ready) {
  auto& n = net();
  if (fd < 0 || !n.ensure_epoll()) return false;
  Slot* old = n.slot(fd);
  if (old && (old->connection || old->ready)) return false;
  Slot& s = old && old->writable ? *old : n.claim(fd);
  s.ready = std::move(ready);
  if (!n.set_events(fd, s, EPOLLIN | (s.writable ? std::uint32_t{EPOLLOUT} : 0u))) {
    serious(strprintf("Cannot watch descriptor %d: %s", fd, sys_error().c_str()), kLogUnbuffered);
    s.ready = nullptr;
    if (!s.writable) n.drop_raw(fd);
    return false;
  }
  return true;
}

bool watch_writable(int fd, std::function<void()> ready) {
  auto& n = net();
  if (fd < 0 || !ready || !n.ensure_epoll()) return false;
  Slot* s = n.slot(fd);
  if (s && s->connection) return false;
  // A slot still registered (its last wait is being answered) is kept.
  if (!s || (!s->ready && !s->writable && !s->watched)) s = &n.claim(fd);
  s->writable = std::move(ready);
  if (!n.set_events(fd, *s, (s->ready ? std::uint32_t{EPOLLIN} : 0u) | EPOLLOUT)) {
    serious(strprintf("Cannot watch descriptor %d: %s", fd, sys_error().c_str()), kLogUnbuffered);
    s->writable = nullptr;
    if (!s->ready) n.drop_raw(fd);
    return false;
  }
  return true;
}

void unwatch(int fd) {
  auto& n = net();
  Slot* s = n.slot(fd);
  if (!s || (!s->ready && !s->writable)) return;
  n.drop_raw(fd);
}

// ---- connections ----------------------------------------------------------------------

Connection* connection_find(std::uint64_t id) {
  auto& n = net();
  auto it = n.entries.find(id);
  return it == n.entries.end() ? nullptr : it->second.connection.get();
}

int connection_count(int service) {
  auto& c = net().counts;
  auto it = c.find(service);
  return it == c.end() ? 0 : it->second;
}

std::size_t connection_total() {
  std::size_t total = 0;
  for (const auto& [service, count] : net().counts) total += static_cast<std::size_t>(count);
  return total;
}

std::uint64_t accepted_total() { return net().accepted; }

Connection* connect_to(int service, std::string_view host, std::uint16_t port, std::unique_ptr<Session> session) {
  auto& n = net();
  if (!n.ensure_epoll() || !session) return nullptr;
  auto made = ConnectionCore::make(n, ++n.last_id, service, static_cast<std::size_t>(socket_buffer_size()));
  Connection& c = n.add(std::move(made), -1, true);
  const ServiceDescriptor* desc = n.service(service);
  ConnectionCore::set_paced_by_lines(c, desc ? desc->paced_by_lines : true);
  if (desc) {
    c.set_line_limit(desc->line_limit);
    c.set_line_ends(desc->line_ends);
    c.set_idle_timeout(desc->timeout ? *desc->timeout : 0);
  }
  if (hooks.default_group) c.set_group(hooks.default_group());
  ConnectionCore::set_session(c, std::move(session));
  ConnectionCore::set_phase(c, Phase::lookup);
  ConnectionCore::set_target_port(c, port);
  const std::uint64_t id = c.id();
  in_addr quad{};
  if (inet_pton(AF_INET, std::string(host).c_str(), &quad) == 1) {
    n.lookups_done.emplace_back(id, quad.s_addr);
  } else if (n.resolver.start) {
    // The answer may come at once or later; either way it is taken up by
    // the loop, never inside this call.
    auto ended = std::make_shared<bool>(false);
    std::uint64_t handle = n.resolver.start(host, [id, ended](std::uint32_t address) {
      *ended = true;
      net().lookups_done.emplace_back(id, address);
    });
    if (!*ended) {
      if (handle) ConnectionCore::set_lookup(c, handle);
      else n.lookups_done.emplace_back(id, 0);
    }
  } else {
    n.lookups_done.emplace_back(id, 0);  // nobody resolves names
  }
  return &c;
}

void net_set_resolver(NameResolver resolver) { net().resolver = std::move(resolver); }

std::uint64_t net_lookup_mail_exchangers(std::string_view domain, std::function<void(MxAnswer)> done) {
  auto& n = net();
  if (!n.resolver.mail_exchangers) {
    done(MxAnswer{});
    return 0;
  }
  return n.resolver.mail_exchangers(domain, std::move(done));
}

void net_cancel_lookup(std::uint64_t handle) {
  auto& n = net();
  if (handle && n.resolver.cancel) n.resolver.cancel(handle);
}

}  // namespace velmor
