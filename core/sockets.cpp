// Socket records and the epoll dispatcher.
//
// The table holds one record per descriptor and grows with the highest
// descriptor in use. Readiness interest follows each record's needs, worked
// out afresh before every wait: listeners read while their service is under
// its connection limit, connected records read while read_buf has room and
// ask for write readiness only while output is pending (or the service
// streams), so an idle suite sleeps in epoll_wait until its next tick.
#include "core/sockets.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <exception>
#include <map>
#include <utility>
#include <vector>

#include "core/control.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/privileges.h"
#include "core/strfmt.h"

namespace velmor {

// ---- IoBuffer ---------------------------------------------------------------

IoBuffer::IoBuffer(std::size_t capacity)
    : buf_(std::make_unique<char[]>(capacity + 1)), capacity_(capacity) {
  buf_[0] = '\0';
}

bool IoBuffer::append(std::string_view text) {
  if (text.size() > room()) return false;
  if (!text.empty()) std::memcpy(buf_.get() + len_, text.data(), text.size());
  commit(text.size());
  return true;
}

void IoBuffer::consume(std::size_t n) {
  if (n >= len_) {
    clear();
    return;
  }
  std::memmove(buf_.get(), buf_.get() + n, len_ - n);
  len_ -= n;
  buf_[len_] = '\0';
}

void IoBuffer::clear() {
  len_ = 0;
  if (buf_) buf_[0] = '\0';
}

void IoBuffer::commit(std::size_t n) {
  len_ += n < room() ? n : room();
  if (buf_) buf_[len_] = '\0';
}

namespace {

// ---- Per-service knowledge of the core ---------------------------------------

// The listening services, in the order listeners_open opens them, with the
// keys that enable them, place them and limit them.
struct ListenerKey {
  int service;
  const bool* enabled;
  const std::int32_t* port;
  const std::int32_t* max;
};
const ListenerKey kListeners[] = {
    {svc::web, &config.web_sock_enabled, &config.web_sock_port, &config.web_sock_max},
    {svc::imap, &config.imap_sock_enabled, &config.imap_sock_port, &config.imap_sock_max},
    {svc::pop, &config.pop_sock_enabled, &config.pop_sock_port, &config.pop_sock_max},
    {svc::smtp, &config.smtp_sock_enabled, &config.smtp_sock_port, &config.smtp_sock_max},
    {svc::nntp, &config.nntp_sock_enabled, &config.nntp_sock_port, &config.nntp_sock_max},
    {svc::proxy, &config.proxy_http_sock_enabled, &config.proxy_http_sock_port,
     &config.proxy_http_sock_max},
    {svc::telnet, &config.proxy_telnet_sock_enabled, &config.proxy_telnet_sock_port,
     &config.proxy_telnet_sock_max},
    {svc::socks, &config.proxy_socks_tcp_enabled, &config.proxy_socks_sock_port,
     &config.proxy_socks_sock_max},
    {svc::raudio, &config.proxy_raudio_tcp_enabled, &config.proxy_raudio_sock_port,
     &config.proxy_raudio_sock_max},
    {svc::ftp, &config.proxy_ftp_sock_enabled, &config.proxy_ftp_sock_port,
     &config.proxy_ftp_sock_max},
};

const ListenerKey* listener_key(int service) {
  if (service == svc::multiport) service = svc::telnet;  // relays share the telnet limit
  for (const auto& key : kListeners)
    if (key.service == service) return &key;
  return nullptr;
}

// Idle time-out of a service from its keys; 0 = none.
int default_idle_timeout(int service) {
  switch (service) {
    case svc::imap: return config.imap_sock_timeout;
    case svc::smtp: case svc::smtp_client: return config.smtp_sock_timeout;
    case svc::pop: case svc::pop_client: return config.pop_sock_timeout;
    case svc::nntp: case svc::news_client: return config.nntp_sock_timeout;
    case svc::web: case svc::web_internal: return config.web_sock_timeout;
    case svc::proxy_server: case svc::proxy: case svc::ssl_server: case svc::ssl_client:
    case svc::cache_request: return 120;
    case svc::telnet_server: case svc::telnet: case svc::multiport_server: case svc::multiport:
      return config.proxy_telnet_sock_timeout;
    case svc::socks_server: case svc::socks: return config.proxy_socks_sock_timeout;
    case svc::raudio_server: case svc::raudio: return config.proxy_raudio_sock_timeout;
    case svc::ftp_server: case svc::ftp: case svc::ftp_data: return config.proxy_ftp_sock_timeout;
    default: return 0;
  }
}

// ---- State --------------------------------------------------------------------

struct Dispatcher {
  int epoll_fd = -1;
  std::vector<std::unique_ptr<SocketRecord>> table;  // indexed by descriptor
  std::size_t records = 0;
  // Records released during a pass; freed after it, so that a handler that
  // closed its own record can still touch it until it returns.
  std::vector<std::unique_ptr<SocketRecord>> released;
  std::map<int, ServiceHandlers> handlers;
  std::map<int, bool> switches;
  std::map<int, int> counts;
  std::map<int, std::uint64_t> bytes_in;
  std::uint64_t accepted = 0;
  std::uint32_t generation = 0;
  std::uint64_t last_id = 0;
  // Connections of each (service, peer address), for the peer's share.
  std::map<std::pair<int, std::uint32_t>, int> peers;
  std::time_t share_logged = 0;
  // Records with a timer set; an entry whose record is gone or whose timer
  // was cancelled is dropped when met.
  struct TimerRef {
    int fd;
    std::uint64_t id;
  };
  std::vector<TimerRef> timers;
  std::vector<epoll_event> events = std::vector<epoll_event>(256);
};
Dispatcher& state() {
  static Dispatcher d;
  return d;
}

void serious(const std::string& text, int flags = 0) { log_write(text, logchan::errors, flags); }
std::string sys_error() { return std::strerror(errno); }

bool ensure_epoll() {
  auto& d = state();
  if (d.epoll_fd >= 0) return true;
  d.epoll_fd = epoll_create1(EPOLL_CLOEXEC);
  if (d.epoll_fd < 0) {
    serious("epoll create failed: " + sys_error(), kLogUnbuffered);
    return false;
  }
  return true;
}

std::uint64_t event_key(const SocketRecord& r) {
  return (static_cast<std::uint64_t>(r.dispatch.generation) << 32) |
         static_cast<std::uint32_t>(r.fd);
}

bool is_datagram(const SocketRecord& r) { return (r.service & kDatagram) != 0; }
bool is_listener(const SocketRecord& r) { return !is_datagram(r) && r.state == sockstate::listening; }

std::int64_t monotonic_ms() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

// A handler that threw: one line to the error log, and its connection is
// closed. Listening and datagram sockets serve everyone, so they stay.
void handler_failed(SocketRecord* r, int service, const char* step, const char* what) {
  serious(strprintf("Service %d: the %s handler failed: %s", service, step, what),
          kLogUnbuffered);
  if (r && !r->closed && !is_datagram(*r) && !is_listener(*r)) socket_close(r->fd);
}

// Runs one handler call: its result, or `failed` when it throws.
template <class F>
int guarded(SocketRecord* r, int service, const char* step, F&& call, int failed = 1) {
  try {
    return call();
  } catch (const std::exception& e) {
    handler_failed(r, service, step, e.what());
  } catch (...) {
    handler_failed(r, service, step, "unknown exception");
  }
  return failed;
}

// The command protocols count a connection as active when a whole line
// arrives, not at every byte.
bool paced_by_lines(int service) {
  switch (service) {
    case svc::smtp: case svc::pop: case svc::imap: case svc::nntp: case svc::web: return true;
    default: return false;
  }
}

int service_limit(int service) {
  const ListenerKey* key = listener_key(service);
  int standard = key ? *key->max : -1;  // -1: no limit
  if (const ServiceHandlers* h = service_handlers(service); h && h->max_connections)
    return guarded(nullptr, service, "limit", h->max_connections, standard);
  return standard;
}

// Connections that count against a listener's limit.
int limit_count(int service) {
  if (service == svc::telnet || service == svc::multiport)
    return connection_count(svc::telnet) + connection_count(svc::multiport);
  return connection_count(service);
}

bool switch_on(int service) {
  auto& sw = state().switches;
  auto it = sw.find(service);
  return it == sw.end() || it->second;
}

std::uint32_t wanted_events(const SocketRecord& r) {
  if (is_datagram(r)) return EPOLLIN;
  if (is_listener(r)) {
    if (r.dispatch.accept_paused_until > server_now) return 0;
    int limit = service_limit(r.service);
    return (limit < 0 || limit_count(r.service) < limit) ? std::uint32_t{EPOLLIN} : 0u;
  }
  if (r.state == sockstate::connecting) return EPOLLOUT;
  if (r.state == sockstate::lookup) return 0;
  std::uint32_t ev = 0;
  if (r.read_buf.room() > 0 && !r.dispatch.peer_eof && r.state != sockstate::closing) ev |= EPOLLIN;
  if (!r.write_buf.empty() || r.want_write) ev |= EPOLLOUT;
  return ev;
}

// Brings the record's registration in line with what it waits for. A record
// waiting for a host lookup is not watched at all: its socket is not
// connected yet, and epoll reports such a socket as hung up at once.
bool sync_interest(SocketRecord& r) {
  const int epfd = state().epoll_fd;
  if (r.state == sockstate::lookup) {
    if (r.dispatch.watched) epoll_ctl(epfd, EPOLL_CTL_DEL, r.fd, nullptr);
    r.dispatch.watched = false;
    return true;
  }
  std::uint32_t ev = wanted_events(r);
  if (r.dispatch.watched && ev == r.dispatch.events) return true;
  epoll_event e{};
  e.events = ev;
  e.data.u64 = event_key(r);
  if (epoll_ctl(epfd, r.dispatch.watched ? EPOLL_CTL_MOD : EPOLL_CTL_ADD, r.fd, &e) != 0) return false;
  r.dispatch.watched = true;
  r.dispatch.events = ev;
  return true;
}

// Closes a record whose peer is gone or failed: the service's peer_closed
// handler decides when it has one.
void peer_gone(SocketRecord& r, long n) {
  const ServiceHandlers* h = service_handlers(r.service);
  if (h && h->peer_closed) {
    if (guarded(&r, r.service, "peer-closed", [&] { return h->peer_closed(r, n); }) != 0 && !r.closed)
      socket_close(r.fd);
    return;
  }
  if (n == 0 && (!r.write_buf.empty() || r.want_write) && !r.closed) {
    // The peer only finished sending: deliver what is pending, then close.
    r.dispatch.peer_eof = true;
    return;
  }
  if (!r.closed) socket_close(r.fd);
}

// Closes the record once it has nothing more to send and either the service
// asked for that (state 999) or the peer finished sending.
void close_when_done(SocketRecord& r) {
  if (r.closed) return;
  if ((r.state == sockstate::closing || r.dispatch.peer_eof) && r.write_buf.empty() && !r.want_write)
    socket_close(r.fd);
}

void write_step(SocketRecord& r) {
  progress_code = 141000;
  if (!r.write_buf.empty() && socket_send(r) < 0) {
    peer_gone(r, -1);
    return;
  }
  const ServiceHandlers* h = service_handlers(r.service);
  if (h && h->write && !r.closed) {
    progress_code = 141010;
    if (guarded(&r, r.service, "write", [&] { return h->write(r); }) != 0 && !r.closed) {
      socket_close(r.fd);
      return;
    }
  }
  close_when_done(r);
}

void read_step(SocketRecord& r) {
  progress_code = 141110;
  const ServiceHandlers* h = service_handlers(r.service);
  if (is_datagram(r)) {
    // Datagram services receive for themselves.
    if (h && h->read) guarded(&r, r.service, "read", [&] { return h->read(r, 0); });
    return;
  }
  if (r.read_buf.room() == 0 || r.dispatch.peer_eof) return;  // never read into a full buffer
  ssize_t n = ::recv(r.fd, r.read_buf.tail(), r.read_buf.room(), 0);
  if (n > 0) {
    if (!paced_by_lines(r.service) || std::memchr(r.read_buf.tail(), '\n', static_cast<std::size_t>(n)))
      r.last_active = server_now;
    r.read_buf.commit(static_cast<std::size_t>(n));
    r.bytes_received += static_cast<std::uint64_t>(n);
    state().bytes_in[r.service] += static_cast<std::uint64_t>(n);
    progress_code = 141120;
    if (h && h->read && guarded(&r, r.service, "read", [&] { return h->read(r, n); }) != 0) {
      if (!r.closed) socket_close(r.fd);
      return;
    }
    // Replies go out at once rather than after another wait.
    if (!r.closed && !r.write_buf.empty()) write_step(r);
    else close_when_done(r);
    return;
  }
  if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR || errno == EINPROGRESS ||
                errno == EALREADY || errno == EISCONN))
    return;
  peer_gone(r, n == 0 ? 0 : -1);
}

void accept_step(SocketRecord& listener) {
  progress_code = 140400;
  auto& d = state();
  const int service = listener.service;
  const ServiceHandlers* h = service_handlers(service);
  for (int i = 0; i < 128; ++i) {  // a bounded batch keeps the other records served
    int limit = service_limit(service);
    if (limit >= 0 && limit_count(service) >= limit) return;  // the rest wait in the backlog
    if (log_mask & logfac::proxy) log_message("Accept request (service):", std::to_string(service), logfac::proxy);
    sockaddr_in peer{};
    socklen_t len = sizeof peer;
    int fd = accept4(listener.fd, reinterpret_cast<sockaddr*>(&peer), &len, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd < 0) {
      if (errno == EMFILE || errno == ENFILE || errno == ENOBUFS || errno == ENOMEM) {
        // Out of descriptors: leave the backlog alone for a second rather
        // than spin on a listener that stays readable.
        serious("Accept failed: " + sys_error());
        listener.dispatch.accept_paused_until = server_now + 1;
      }
      return;
    }
    std::string peer_text = peer.sin_family == AF_INET ? dotted(peer.sin_addr.s_addr) : std::string("unknown");
    if (log_mask & logfac::proxy) log_message("Accepted:", peer_text, logfac::proxy);
    if (!switch_on(service)) {
      ::close(fd);
      continue;
    }
    std::uint32_t peer_ip = peer.sin_family == AF_INET ? peer.sin_addr.s_addr : 0;
    if (!peer_may_connect(service, peer_ip)) {
      if (d.share_logged != server_now) {  // at most a line a second, however hard a peer tries
        d.share_logged = server_now;
        log_message(strprintf("Service %d: connection refused, too many from ", service), peer_text);
      }
      ::close(fd);
      continue;
    }
    SocketRecord* r = record_create(fd, service, sockstate::initial);
    if (!r) {
      serious(strprintf("Record create failed, service:%d", service));
      ::close(fd);
      continue;
    }
    record_set_peer(*r, peer_ip);
    if (peer.sin_family != AF_INET) r->peer_addr = std::move(peer_text);
    r->dispatch.accepted = true;
    ++d.accepted;
    if (h && h->accept && guarded(r, service, "accept", [&] { return h->accept(*r); }) != 0) {
      if (!r->closed) socket_close(r->fd);
      continue;
    }
    if (!r->closed && !r->write_buf.empty()) write_step(*r);  // the greeting goes out now
  }
}

// An outward connection became writable (or failed).
void connect_step(SocketRecord& r) {
  int error = 0;
  socklen_t len = sizeof error;
  if (getsockopt(r.fd, SOL_SOCKET, SO_ERROR, &error, &len) != 0) error = errno;
  if (error == EINPROGRESS || error == EALREADY) return;
  const ServiceHandlers* h = service_handlers(r.service);
  if (error != 0) {
    if (h && h->connect_failed) guarded(&r, r.service, "connect-failed", [&] { return h->connect_failed(r), 0; });
    else socket_close(r.fd);
    return;
  }
  r.state = sockstate::connected;
  r.last_active = server_now;
  if (h && h->connect_done) guarded(&r, r.service, "connect", [&] { return h->connect_done(r), 0; });
  if (!r.closed && !r.write_buf.empty()) write_step(r);
}

void lookup_step(SocketRecord& r) {
  r.dispatch.lookup_ended = false;
  const ServiceHandlers* h = service_handlers(r.service);
  if (r.dispatch.lookup_ok) {
    if (h && h->lookup_done) guarded(&r, r.service, "lookup", [&] { return h->lookup_done(r), 0; });
    return;
  }
  if (h && h->lookup_failed) guarded(&r, r.service, "lookup-failed", [&] { return h->lookup_failed(r), 0; });
  else socket_close(r.fd);
}

void deliver(SocketRecord& r, std::uint32_t ev) {
  if (r.state == sockstate::lookup) return;  // its turn comes with the lookup's end
  if (r.state == sockstate::connecting && !is_datagram(r)) {
    progress_code = 140102;
    connect_step(r);
    return;
  }
  if (ev & (EPOLLIN | EPOLLHUP | EPOLLERR)) {
    progress_code = 140104;
    if (is_listener(r)) {
      accept_step(r);
      return;
    }
    if (is_datagram(r) || (r.read_buf.room() > 0 && !r.dispatch.peer_eof)) {
      read_step(r);
    } else if ((ev & (EPOLLHUP | EPOLLERR)) && !(ev & EPOLLOUT)) {
      peer_gone(r, -1);  // the connection failed while nothing more could be read
      return;
    }
  }
  if (!r.closed && (ev & EPOLLOUT) && !is_datagram(r) && !is_listener(r)) write_step(r);
}

void free_released() { state().released.clear(); }

// Runs the timers that are due; returns the milliseconds until the next one
// (-1 = none).
int run_timers() {
  auto& d = state();
  std::int64_t now = monotonic_ms(), next = -1;
  std::vector<Dispatcher::TimerRef> due;
  std::erase_if(d.timers, [&](const Dispatcher::TimerRef& t) {
    SocketRecord* r = record_for(t.fd);
    if (!r || r->id != t.id || r->dispatch.timer_due == 0) return true;
    if (r->dispatch.timer_due <= now) {
      due.push_back(t);
      return true;
    }
    if (next < 0 || r->dispatch.timer_due < next) next = r->dispatch.timer_due;
    return false;
  });
  for (const auto& t : due) {
    SocketRecord* r = record_for(t.fd);
    if (!r || r->id != t.id || r->dispatch.timer_due == 0) continue;
    r->dispatch.timer_due = 0;
    const ServiceHandlers* h = service_handlers(r->service);
    if (h && h->timer && guarded(r, r->service, "timer", [&] { return h->timer(*r); }) != 0) {
      if (!r->closed) socket_close(r->fd);
      continue;
    }
    if (!r->closed && !r->write_buf.empty()) write_step(*r);
    else close_when_done(*r);
    if (!r->closed && r->dispatch.timer_due != 0 && (next < 0 || r->dispatch.timer_due < next))
      next = r->dispatch.timer_due;  // set again by its own handler
  }
  return next < 0 ? -1 : static_cast<int>(std::max<std::int64_t>(0, next - monotonic_ms()));
}

}  // namespace

// ---- Registration and switches ----------------------------------------------------

void register_service(int service, ServiceHandlers handlers) {
  state().handlers[service] = std::move(handlers);
}

const ServiceHandlers* service_handlers(int service) {
  auto& h = state().handlers;
  auto it = h.find(service);
  return it == h.end() ? nullptr : &it->second;
}

void service_switch(int service, bool on) { state().switches[service] = on; }

// ---- Records ---------------------------------------------------------------------

SocketRecord* record_for(int fd) {
  auto& t = state().table;
  if (fd < 0 || static_cast<std::size_t>(fd) >= t.size()) return nullptr;
  return t[static_cast<std::size_t>(fd)].get();
}

SocketRecord* record_create(int fd, int service, int st) {
  progress_code = 141510;
  auto& d = state();
  if (fd < 0 || !ensure_epoll()) return nullptr;
  if (record_for(fd)) {
    serious(strprintf("Record create failed, descriptor %d already has a record", fd), kLogUnbuffered);
    return nullptr;
  }
  auto r = std::make_unique<SocketRecord>();
  r->fd = fd;
  r->service = service;
  r->state = st;
  r->created = r->last_active = server_now;
  r->id = ++d.last_id;
  r->dispatch.generation = ++d.generation;
  if (hooks.default_group) r->group_opts = hooks.default_group();
  bool bare = (service & kDatagram) != 0 || st == sockstate::listening;
  if (!bare) {
    auto size = static_cast<std::size_t>(socket_buffer_size());
    r->read_buf = IoBuffer(size);
    r->write_buf = IoBuffer(size);
    r->dispatch.counted_service = service;
    ++d.counts[service];
  }
  if (!sync_interest(*r)) {
    serious(strprintf("Record create failed, descriptor %d: %s", fd, sys_error().c_str()), kLogUnbuffered);
    if (!bare) --d.counts[service];
    return nullptr;
  }
  if (static_cast<std::size_t>(fd) >= d.table.size()) d.table.resize(static_cast<std::size_t>(fd) + 64);
  d.table[static_cast<std::size_t>(fd)] = std::move(r);
  ++d.records;
  return d.table[static_cast<std::size_t>(fd)].get();
}

void record_set_peer(SocketRecord& record, std::uint32_t peer_nbo) {
  record.peer_ip = peer_nbo;
  record.peer_addr = dotted(peer_nbo);
  if (record.dispatch.peer_counted || peer_nbo == 0) return;
  ++state().peers[{record.service, peer_nbo}];
  record.dispatch.peer_counted = true;
}

bool peer_may_connect(int service, std::uint32_t peer_nbo) {
  if ((ntohl(peer_nbo) >> 24) == 127) return true;  // loopback: this machine's own programs
  int limit = service_limit(service);
  if (limit < 0) return true;
  auto& peers = state().peers;
  auto it = peers.find({service, peer_nbo});
  return it == peers.end() || it->second < std::max(1, limit / 4);
}

void socket_timer(SocketRecord& record, int ms) {
  bool listed = record.dispatch.timer_due != 0;
  record.dispatch.timer_due = ms > 0 ? monotonic_ms() + ms : 0;
  if (ms > 0 && !listed) state().timers.push_back({record.fd, record.id});
}

void record_lookup_complete(SocketRecord& record, bool ok) {
  record.dispatch.lookup_ended = true;
  record.dispatch.lookup_ok = ok;
}

int record_close(int fd) {
  SocketRecord* r = record_for(fd);
  if (!r) return 1;
  auto saved = progress_code.load();
  progress_code = 141800;
  auto& d = state();
  if (log_mask & logfac::proxy)
    log_message(strprintf("record close, service:%d, state:%d", r->service, r->state), {}, logfac::proxy);
  // Take the record out of the table first, so a release that closes a
  // partner (which may close this one in turn) finds it gone.
  std::unique_ptr<SocketRecord> owned = std::move(d.table[static_cast<std::size_t>(fd)]);
  --d.records;
  r->closed = true;
  if (r->dispatch.watched) epoll_ctl(d.epoll_fd, EPOLL_CTL_DEL, fd, nullptr);
  if (r->state != sockstate::listening) {
    const ServiceHandlers* h = service_handlers(r->service);
    if (h && h->release) guarded(r, r->service, "release", [&] { return h->release(*r), 0; });
  }
  if (int counted = r->dispatch.counted_service; counted != 0) {
    int& c = d.counts[counted];
    if (c > 0) --c;
    r->dispatch.counted_service = 0;
  }
  if (r->dispatch.peer_counted) {
    auto it = d.peers.find({r->service, r->peer_ip});
    if (it != d.peers.end() && --it->second <= 0) d.peers.erase(it);
    r->dispatch.peer_counted = false;
  }
  r->file = CacheFile();
  r->send_file = CacheFile();
  d.released.push_back(std::move(owned));
  progress_code = saved;
  return 0;
}

void socket_close(int fd) {
  SocketRecord* r = record_for(fd);
  if (!r) return;
  if (record_close(fd) != 0) return;
  if (log_mask & logfac::proxy) log_message("close:", std::to_string(fd), logfac::proxy);
  if (::close(fd) != 0 && errno != EINPROGRESS && errno != EINTR)
    serious(strprintf("Sock %d close problem %d ", fd, errno));
  r->fd = -1;
}

void sockets_close_all() {
  auto& t = state().table;
  for (std::size_t fd = 0; fd < t.size(); ++fd)
    if (t[fd]) socket_close(static_cast<int>(fd));
  free_released();
}

std::size_t record_count() { return state().records; }

// ---- Sending -------------------------------------------------------------------------

long socket_send(SocketRecord& record, std::string_view data) {
  if (record.fd < 0 || record.closed) {
    serious("Serious error during write: record corrupt - please report");
    return -1;
  }
  if (data.empty()) return 0;
  ssize_t n = ::send(record.fd, data.data(), data.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
  if (n < 0) {
    if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR) return 0;
    return -1;
  }
  if (n > 0) {
    record.last_active = server_now;
    record.bytes_sent += static_cast<std::uint64_t>(n);
  }
  return n;
}

long socket_send(SocketRecord& record) {
  long n = socket_send(record, record.write_buf.view());
  if (n > 0) record.write_buf.consume(static_cast<std::size_t>(n));
  return n;
}

// ---- Descriptors --------------------------------------------------------------------

int socket_options(int fd) {
  int fl = fcntl(fd, F_GETFL);
  if (fl < 0 || fcntl(fd, F_SETFL, fl | O_NONBLOCK) != 0) {
    serious("Set nonblock failed: " + sys_error());
    return 1;
  }
  int fdf = fcntl(fd, F_GETFD);
  if (fdf < 0 || fcntl(fd, F_SETFD, fdf | FD_CLOEXEC) != 0) {
    serious("Set close-on-exec failed: " + sys_error());
    return 1;
  }
  linger off{};
  if (setsockopt(fd, SOL_SOCKET, SO_LINGER, &off, sizeof off) != 0) {
    serious("Set linger pff failed: " + sys_error());
    return 1;
  }
  int one = 1;
  if (setsockopt(fd, SOL_SOCKET, SO_REUSEADDR, &one, sizeof one) != 0) {
    serious("Set reuse addr failed: " + sys_error());
    return 1;
  }
  return 0;
}

int listener_open(int port, int service, int protocol, int* descriptor_out) {
  const bool tcp = protocol != 17;
  int fd = ::socket(AF_INET, (tcp ? SOCK_STREAM : SOCK_DGRAM) | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    std::string msg = strprintf("%s Socket create for port:%d failed: %s", tcp ? "TCP" : "UDP", port,
                                sys_error().c_str());
    serious(msg);
    log_message(msg);
    return 1;
  }
  if (socket_options(fd) != 0) {
    serious("Sock opt set problem: " + sys_error(), kLogUnbuffered);
    ::close(fd);
    return -1;
  }
  if (tcp || port != 0) {
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_port = htons(static_cast<std::uint16_t>(port));
    a.sin_addr.s_addr = htonl(INADDR_ANY);
    if (!paths.bind_address.empty() && inet_pton(AF_INET, paths.bind_address.c_str(), &a.sin_addr) != 1) {
      std::string msg = "Bind address not understood: " + paths.bind_address;
      serious(msg, kLogUnbuffered);
      log_message(msg);
      ::close(fd);
      return 1;
    }
    int bound;
    {
      BindingPrivileges root;  // the only step that may need root
      bound = ::bind(fd, reinterpret_cast<sockaddr*>(&a), sizeof a);
    }
    if (bound != 0) {
      std::string msg = strprintf("Bind Failed - is another server running on this port: %d", port);
      serious(msg, kLogUnbuffered);
      log_message(msg);
      ::close(fd);
      return 1;
    }
  }
  if (tcp && ::listen(fd, 128) != 0) {
    std::string msg = strprintf("Listen failed on port %d: %s", port, sys_error().c_str());
    serious(msg, kLogUnbuffered);
    log_message(msg);
    ::close(fd);
    return 1;
  }
  SocketRecord* r = tcp ? record_create(fd, service, sockstate::listening)
                        : record_create(fd, service | kDatagram, sockstate::initial);
  if (!r) {
    ::close(fd);
    return 2;
  }
  if (descriptor_out) *descriptor_out = fd;
  return 0;
}

int socket_connect(const sockaddr_in& address) {
  if (address.sin_addr.s_addr == 0) {
    serious("Bad (NULL) TCP/IP address on sock open");
    return -1;
  }
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    serious("Socket create failed: " + sys_error());
    return -1;
  }
  sockaddr_in a = address;
  a.sin_family = AF_INET;
  if (::connect(fd, reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 && errno != EINPROGRESS) {
    serious("Connect failed: " + sys_error());
    ::close(fd);
    return -1;
  }
  return fd;
}

int socket_datagram() {
  int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) serious("Socket create failed: " + sys_error());
  return fd;
}

// ---- Start-up ----------------------------------------------------------------------------

int listeners_open() {
  auto& t = state().table;
  for (std::size_t fd = 0; fd < t.size(); ++fd) {
    SocketRecord* r = t[fd].get();
    if (r && (is_listener(*r) || r->service == (svc::control | kDatagram))) socket_close(static_cast<int>(fd));
  }
  for (const auto& key : kListeners) {
    const ServiceHandlers* h = service_handlers(key.service);
    if (!h || !*key.enabled) continue;  // a service not built yet gets no listener
    int result = h->open_sockets ? guarded(nullptr, key.service, "open", h->open_sockets)
                                 : listener_open(*key.port, key.service, 6);
    if (result != 0) return 1;
  }
  // Services of their own kind (the resolver, the multi-port relays) open
  // their sockets when they are registered.
  auto open_own = [](int service) {
    const ServiceHandlers* h = service_handlers(service);
    return h && h->open_sockets ? guarded(nullptr, service, "open", h->open_sockets) : 0;
  };
  if (open_own(svc::dns | kDatagram) != 0) return 1;
  // Without its control channel the suite could not be steered, and a
  // squatter on the path would get what local tools send: no start.
  if (control_open() != 0) return 1;
  return open_own(svc::multiport) != 0 ? 1 : 0;
}

int sockets_init() {
  if (!ensure_epoll()) return 1;
  // Serving many clients needs many descriptors: take what the system allows.
  rlimit lim{};
  if (getrlimit(RLIMIT_NOFILE, &lim) == 0 && lim.rlim_cur < lim.rlim_max) {
    lim.rlim_cur = lim.rlim_max == RLIM_INFINITY ? 65536 : lim.rlim_max;
    setrlimit(RLIMIT_NOFILE, &lim);
  }
  if (config.admin_email && config.admin_email->find('@') == std::string::npos) {
    std::string domain = text_of(config.mail_domains);
    domain = domain.substr(0, domain.find_first_of(", \t"));
    if (domain.empty()) domain = text_of(config.server_name);
    if (!domain.empty()) *config.admin_email += "@" + domain;
  }
  for (const auto& key : kListeners) service_switch(key.service, *key.enabled);
  service_switch(svc::multiport, config.proxy_telnet_sock_enabled);
  return listeners_open();
}

// ---- The dispatcher --------------------------------------------------------------------------

void dispatcher(int timeout_ms) {
  auto& d = state();
  free_released();
  if (!ensure_epoll()) return;
  progress_code = 140100;
  const int timer_ms = run_timers();  // first, so that what they queue is watched
  // Lookups that ended since the last pass, and the interest of every record.
  bool lookups = false;
  for (std::size_t fd = 0; fd < d.table.size(); ++fd) {
    SocketRecord* r = d.table[fd].get();
    if (!r) continue;
    if (r->state == sockstate::lookup && r->dispatch.lookup_ended) {
      lookup_step(*r);
      lookups = true;
      if (r->closed) continue;
    }
    sync_interest(*r);
  }
  if (lookups) timeout_ms = 0;
  if (timer_ms >= 0 && (timeout_ms < 0 || timer_ms < timeout_ms)) timeout_ms = timer_ms;
  int n = epoll_wait(d.epoll_fd, d.events.data(), static_cast<int>(d.events.size()), timeout_ms);
  for (int i = 0; i < n; ++i) {
    const epoll_event& e = d.events[static_cast<std::size_t>(i)];
    int fd = static_cast<int>(e.data.u64 & 0xffffffffu);
    SocketRecord* r = record_for(fd);
    // A descriptor closed earlier in this pass may already carry a new record.
    if (!r || r->dispatch.generation != static_cast<std::uint32_t>(e.data.u64 >> 32)) continue;
    deliver(*r, e.events);
  }
  if (n == static_cast<int>(d.events.size())) d.events.resize(d.events.size() * 2);
  progress_code = 140110;
  free_released();
}

void sockets_check_timeouts() {
  auto& t = state().table;
  for (std::size_t fd = 0; fd < t.size(); ++fd) {
    SocketRecord* r = t[fd].get();
    if (!r || is_datagram(*r) || is_listener(*r)) continue;
    const ServiceHandlers* h = service_handlers(r->service);
    int idle = default_idle_timeout(r->service);
    if (h && h->idle_timeout) idle = guarded(nullptr, r->service, "idle time-out", h->idle_timeout, idle);
    int session = r->dispatch.accepted ? config.sock_session_max : 0;
    if (h && h->session_limit) session = guarded(nullptr, r->service, "session limit", h->session_limit, session);
    bool idle_out = idle > 0 && server_now - r->last_active > idle;
    if (!idle_out && (session <= 0 || server_now - r->created <= session)) continue;
    if (h && h->timed_out) guarded(r, r->service, "time-out", [&] { return h->timed_out(*r), 0; });
    else socket_close(r->fd);
  }
}

// ---- Counters ----------------------------------------------------------------------------

int connection_count(int service) {
  auto& c = state().counts;
  auto it = c.find(service);
  return it == c.end() ? 0 : it->second;
}

std::uint64_t accepted_total() { return state().accepted; }

std::uint64_t service_bytes_received(int service) {
  auto& b = state().bytes_in;
  auto it = b.find(service);
  return it == b.end() ? 0 : it->second;
}

PeerRule peer_rule(std::uint32_t peer_nbo, const AddressList& allow, const AddressList& block,
                   const AddressList* auth) {
  progress_code = 140500;
  if (address_list_match(allow, peer_nbo)) return PeerRule::allowed;
  if (address_list_match(block, peer_nbo)) return PeerRule::blocked;
  if (auth && address_list_match(*auth, peer_nbo)) return PeerRule::must_auth;
  return PeerRule::ordinary;
}

// ---- Telnet -------------------------------------------------------------------------------

int telnet_filter(SocketRecord& record) {
  constexpr unsigned char IAC = 255, WILL = 251, WONT = 252, DONT = 254;  // DO is 253
  IoBuffer& in = record.read_buf;
  const auto* p = reinterpret_cast<const unsigned char*>(in.data());
  const std::size_t len = in.size();
  std::size_t i = 0;
  while (i < len) {
    unsigned char c = p[i];
    if (c == IAC) {
      if (i + 1 >= len) break;  // the rest of the sequence comes with the next read
      unsigned char verb = p[i + 1];
      if (verb >= WILL && verb <= DONT) {
        if (i + 2 >= len) break;
        char answer[3] = {static_cast<char>(IAC), static_cast<char>(verb == WILL ? DONT : WONT),
                          static_cast<char>(p[i + 2])};
        // Without room the answer is dropped; the negotiation only goes unanswered.
        record.write_buf.append(std::string_view(answer, 3));
        i += 3;
      } else {
        i += 2;
      }
      continue;
    }
    if ((c >= 1 && c <= 6) || (c >= 14 && c <= 31)) {
      ++i;
      continue;
    }
    break;  // printable, NUL or 7..13: the data begins
  }
  in.consume(i);
  if (in.empty()) return 0;
  // Only the start of an unfinished sequence left: nothing to use yet.
  return static_cast<unsigned char>(in.data()[0]) == IAC ? 0 : 1;
}

std::string dotted(std::uint32_t address_nbo) {
  const auto* b = reinterpret_cast<const unsigned char*>(&address_nbo);
  return strprintf("%u.%u.%u.%u", b[0], b[1], b[2], b[3]);
}

}  // namespace velmor
