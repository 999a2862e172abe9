// The Connection: input buffer and line reader, output queue, the one close
// path, and the turn the loop (or the test driver) gives it.
#include "core/connection.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <exception>

#include "core/connection_core.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/strfmt.h"
#include "core/tls.h"

namespace velmor {

namespace {

constexpr std::size_t kStage = 64 * 1024;     // file bytes read per refill
constexpr std::size_t kChunkJoin = 64 * 1024;  // sends join a chunk up to this size
constexpr int kReadsPerTurn = 4;
constexpr int kInputRounds = 8;

}  // namespace

const char* close_reason_text(CloseReason reason) {
  switch (reason) {
    case CloseReason::requested: return "requested";
    case CloseReason::peer_closed: return "peer closed";
    case CloseReason::peer_reset: return "peer reset";
    case CloseReason::timed_out: return "timed out";
    case CloseReason::session_limit: return "session limit";
    case CloseReason::connect_failed: return "connect failed";
    case CloseReason::lookup_failed: return "lookup failed";
    case CloseReason::shutdown: return "shutdown";
    case CloseReason::failed: return "failed";
    case CloseReason::tls_failed: return "TLS failed";
  }
  return "?";
}

bool Peer::loopback() const { return (ntohl(ip) >> 24) == 127; }

std::string dotted(std::uint32_t address_nbo) {
  const auto* b = reinterpret_cast<const unsigned char*>(&address_nbo);
  return strprintf("%u.%u.%u.%u", b[0], b[1], b[2], b[3]);
}

// ---- PlainTransport ------------------------------------------------------------

Transport::Io PlainTransport::read(char* to, std::size_t room, std::size_t& got) {
  got = 0;
  ssize_t n = ::recv(fd_.get(), to, room, 0);
  if (n > 0) {
    got = static_cast<std::size_t>(n);
    return Io::ok;
  }
  if (n == 0) return Io::closed;
  if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR) return Io::would_block;
  return Io::failed;
}

Transport::Io PlainTransport::write(std::span<const std::string_view> parts, std::size_t& put) {
  put = 0;
  iovec iov[16];
  std::size_t n = 0;
  for (std::string_view p : parts) {
    if (n == 16) break;
    if (p.empty()) continue;
    iov[n].iov_base = const_cast<char*>(p.data());
    iov[n].iov_len = p.size();
    ++n;
  }
  if (n == 0) return Io::ok;
  msghdr msg{};
  msg.msg_iov = iov;
  msg.msg_iovlen = n;
  ssize_t sent = ::sendmsg(fd_.get(), &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
  if (sent >= 0) {
    put = static_cast<std::size_t>(sent);
    return Io::ok;
  }
  if (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR) return Io::would_block;
  return Io::failed;
}

bool PlainTransport::can_upgrade(const TlsPlan& plan) const {
  return fd_ && (plan.role == TlsRole::client || tls_available());
}

std::unique_ptr<Transport> PlainTransport::upgrade(const TlsPlan& plan) {
  if (!can_upgrade(plan)) return nullptr;
  return tls_transport(std::move(fd_), plan);
}

// ---- Connection: the session's side ----------------------------------------------

Connection::Connection(ConnectionHost& host, std::uint64_t id, int service, std::size_t capacity)
    : host_(host), id_(id), service_(service), capacity_(std::max<std::size_t>(capacity, 16)) {
  created_ = last_active_ = server_now;
}

Connection::~Connection() = default;

bool Connection::secure() const { return transport_ && transport_->secure(); }

bool Connection::gate_open() const {
  return !closed_ && !close_pending_ && phase_ == Phase::open && !paused_ && !was_full_ && tls_step_ == TlsStep::none;
}

Connection::TlsStart Connection::start_tls() { return begin_tls(TlsPlan{}); }

Connection::TlsStart Connection::start_tls_client(std::string host, TlsVerify verify) {
  return begin_tls(TlsPlan{TlsRole::client, std::move(host), verify});
}

Connection::TlsStart Connection::begin_tls(TlsPlan plan) {
  if (closed_ || close_pending_ || phase_ != Phase::open || !transport_) return TlsStart::unavailable;
  if (tls_step_ != TlsStep::none || transport_->secure()) return TlsStart::already;
  if (!transport_->can_upgrade(plan)) return TlsStart::unavailable;
  // Whatever the peer sent behind the command was sent before it could know
  // the answer: it is no part of the encrypted dialogue.
  drop_input(in_end_ - in_start_);
  skipping_ = lf_pending_ = false;
  tls_plan_ = std::make_unique<TlsPlan>(std::move(plan));
  tls_step_ = TlsStep::queued;
  out_.emplace_back().upgrade = true;
  if (!in_callback_) host_.touch(*this);
  return TlsStart::started;
}

// The upgrade point reached the front of the output queue: what came
// before it is sent. Anything read meanwhile is dropped again.
bool Connection::upgrade_transport() {
  out_.pop_front();
  drop_input(in_end_ - in_start_);
  std::unique_ptr<Transport> next = transport_->upgrade(*tls_plan_);
  tls_plan_.reset();
  if (!next) {
    log_write(strprintf("Service %d: TLS could not start for %s", service_, peer_.text.c_str()), logchan::errors);
    close_now(CloseReason::tls_failed);
    return false;
  }
  transport_ = std::move(next);
  tls_step_ = TlsStep::handshaking;
  advance();
  return !close_pending_ && !closed_;
}

// Drives the transport's own work (a handshake). A failure closes the
// connection; a finished handshake lets the session have its input.
void Connection::advance() {
  if (!transport_ || closed_ || close_pending_) return;
  Transport::Io io = transport_->advance();
  if (io == Transport::Io::failed || io == Transport::Io::closed) {
    tls_note_failure(peer_.text, service_, transport_->failure());
    close_now(CloseReason::tls_failed);
    return;
  }
  if (io == Transport::Io::ok && tls_step_ == TlsStep::handshaking) {
    tls_step_ = TlsStep::none;
    dirty_ = true;
  }
}

void Connection::drop_input(std::size_t n) {
  in_start_ += std::min(n, in_end_ - in_start_);
  if (in_start_ == in_end_) in_start_ = in_end_ = 0;
}

// A bare CR ended the last line (LineEnds::cr_too): an LF right behind it,
// in this read or a later one, belongs to that line end.
void Connection::swallow_lf() {
  if (!lf_pending_ || in_start_ == in_end_) return;
  lf_pending_ = false;
  if (in_[in_start_] == '\n') drop_input(1);
}

void Connection::note_line() {
  if (paced_by_lines_) last_active_ = server_now;
}

LineResult Connection::read_line(std::string_view& line) {
  line = {};
  if (!gate_open()) {
    gated_ = true;
    return LineResult::need_more;
  }
  const std::size_t limit = line_limit_ ? line_limit_ : capacity_;
  const bool cr_ends = line_ends_ == LineEnds::cr_too;
  for (;;) {
    swallow_lf();
    std::string_view in = data();
    std::size_t end = cr_ends ? in.find_first_of("\r\n") : in.find('\n');
    if (skipping_) {
      if (end == std::string_view::npos) {
        drop_input(in.size());
        return LineResult::need_more;
      }
      skipping_ = false;
      std::size_t used = end + 1;
      if (in[end] == '\r') {
        if (used < in.size()) {
          if (in[used] == '\n') ++used;
        } else {
          lf_pending_ = true;
        }
      }
      drop_input(used);
      note_line();
      continue;
    }
    if (end == std::string_view::npos) {
      // No line end yet. Over the limit (a CR may still be waiting for its
      // LF), or a full buffer: refused now, the rest skipped as it comes.
      if (in.size() > limit + (cr_ends ? 0 : 1) || in_end_ - in_start_ >= capacity_) {
        drop_input(in.size());
        skipping_ = true;
        return LineResult::overlong;
      }
      return LineResult::need_more;
    }
    std::size_t used = end + 1, length = end;
    if (in[end] == '\r') {
      if (used < in.size()) {
        if (in[used] == '\n') ++used;
      } else {
        lf_pending_ = true;
      }
    } else if (end > 0 && in[end - 1] == '\r') {
      --length;
    }
    drop_input(used);  // the bytes stay where they are until the core reads again
    note_line();
    if (length > limit) return LineResult::overlong;
    line = in.substr(0, length);
    return LineResult::line;
  }
}

std::string_view Connection::buffered() {
  if (closed_) return {};
  swallow_lf();
  return data();
}

void Connection::consume(std::size_t n) { drop_input(n); }

bool Connection::input_full() const { return in_end_ - in_start_ >= capacity_; }

void Connection::pause_input() { paused_ = true; }

void Connection::resume_input() {
  if (!paused_) return;
  paused_ = false;
  dirty_ = true;
  if (!in_callback_ && !closed_) host_.touch(*this);
}

void Connection::yield_turn() {
  if (closed_ || yielded_) return;
  yielded_ = true;
  host_.next_pass(*this);
}

void Connection::send(std::string_view bytes) {
  if (closed_ || close_pending_ || phase_ == Phase::closing || bytes.empty()) return;
  if (!out_.empty() && !out_.back().is_file && !out_.back().upgrade && out_.back().bytes.size() < kChunkJoin) {
    out_.back().bytes.append(bytes);
  } else {
    out_.emplace_back().bytes.assign(bytes);
  }
  pending_ += bytes.size();
  note_fullness();
  if (!in_callback_) host_.touch(*this);
}

void Connection::send_file(FileRange range) {
  if (closed_ || close_pending_ || phase_ == Phase::closing || range.length == 0 || !range.file) return;
  OutItem& item = out_.emplace_back();
  item.is_file = true;
  pending_ += range.length;
  item.file = std::move(range);
  note_fullness();
  if (!in_callback_) host_.touch(*this);
}

void Connection::close_after_send() {
  if (closed_ || close_pending_ || phase_ == Phase::closing) return;
  phase_ = Phase::closing;
  drop_input(in_end_ - in_start_);
  if (!in_callback_) host_.touch(*this);
}

void Connection::close_now(CloseReason reason) {
  if (closed_ || close_pending_) return;
  if (in_callback_) {
    // Finished when the callback that asked returns.
    close_pending_ = true;
    close_reason_ = reason;
    return;
  }
  finish(reason);
}

void Connection::wake_after(std::chrono::milliseconds delay) {
  if (closed_) return;
  wake_due_ms_ = delay.count() > 0 ? host_.now_ms() + delay.count() : 0;
  host_.timer_changed(*this, wake_due_ms_);
}

void Connection::link(Connection& partner) {
  if (&partner == this) return;
  unlink();
  partner.unlink();
  partner_ = &partner;
  partner.partner_ = this;
}

void Connection::unlink() {
  if (!partner_) return;
  Connection* other = partner_;
  partner_ = nullptr;
  other->partner_ = nullptr;
  if (!other->closed_) host_.touch(*other);
}

// ---- Connection: the core's side ----------------------------------------------------

template <class F>
void Connection::call(const char* step, F&& f) {
  if (closed_ || !session_) return;
  ++in_callback_;
  try {
    f(*session_);
  } catch (const std::exception& e) {
    log_write(strprintf("Service %d: the %s handler failed: %s", service_, step, e.what()), logchan::errors,
              kLogUnbuffered);
    close_pending_ = true;
    close_reason_ = CloseReason::failed;
  } catch (...) {
    log_write(strprintf("Service %d: the %s handler failed: unknown exception", service_, step), logchan::errors,
              kLogUnbuffered);
    close_pending_ = true;
    close_reason_ = CloseReason::failed;
  }
  --in_callback_;
}

// The one way out: the session is told, the partner let go, the loop
// forgets the connection, and the descriptor closes.
void Connection::finish(CloseReason reason) {
  if (closed_) return;
  close_pending_ = false;
  close_reason_ = reason;
  ++in_callback_;  // nothing the session does now re-enters the close
  if (session_) {
    try {
      session_->on_close(*this, reason);
    } catch (const std::exception& e) {
      log_write(strprintf("Service %d: the close handler failed: %s", service_, e.what()), logchan::errors,
                kLogUnbuffered);
    } catch (...) {
      log_write(strprintf("Service %d: the close handler failed", service_), logchan::errors, kLogUnbuffered);
    }
  }
  closed_ = true;
  close_pending_ = false;
  --in_callback_;
  unlink();
  out_.clear();
  pending_ = 0;
  wake_due_ms_ = 0;
  host_.release(*this);
  transport_.reset();  // closes the descriptor
  fd_ = -1;
}

void Connection::note_fullness() {
  if (pending_ >= kHighWater) {
    was_full_ = true;
    return;
  }
  if (!was_full_ || pending_ > kLowWater) return;
  was_full_ = false;
  dirty_ = true;  // held-back input may go on
  call("drained", [&](Session& s) { s.on_drained(*this); });
  if (partner_ && !partner_->closed_) host_.touch(*partner_);
}

// The stage for `raw` with each line of a lone "." (a dot, then CR or LF)
// doubled; a line's first "." at the end of `raw` is settled by the next.
void Connection::stuff_lone_dots(OutItem& item, std::string_view raw) {
  std::string& out = item.stage;
  out.clear();
  out.reserve(raw.size() + 8);
  auto line_end = [](char ch) { return ch == '\r' || ch == '\n'; };
  if (item.dot_ahead && line_end(raw.front())) out += '.';
  std::size_t copied = 0;
  auto next_line = [&raw](std::size_t from) {
    std::size_t lf = raw.find('\n', from);
    return lf == std::string_view::npos ? raw.size() : lf + 1;
  };
  for (std::size_t at = item.line_start ? 0 : next_line(0); at < raw.size(); at = next_line(at)) {
    if (raw[at] == '.' && at + 1 < raw.size() && line_end(raw[at + 1])) {
      out.append(raw.substr(copied, at + 1 - copied));
      out += '.';
      copied = at + 1;
    }
  }
  out.append(raw.substr(copied));
  item.dot_ahead = raw.back() == '.' && (raw.size() > 1 ? raw[raw.size() - 2] == '\n' : item.line_start);
  item.line_start = raw.back() == '\n';
}

// Reads the next part of a file range into its stage, transformed.
bool Connection::fill_stage(OutItem& item) {
  FileRange& f = item.file;
  std::string raw(static_cast<std::size_t>(std::min<std::uint64_t>(kStage, f.length)), '\0');
  ssize_t n;
  do {
    n = ::pread(f.file->get(), raw.data(), raw.size(), static_cast<off_t>(f.offset));
  } while (n < 0 && errno == EINTR);
  if (n <= 0) return false;
  raw.resize(static_cast<std::size_t>(n));
  f.offset += static_cast<std::uint64_t>(n);
  f.length -= static_cast<std::uint64_t>(n);
  item.done = 0;
  if (f.transform == FileRange::Transform::none) {
    item.stage = std::move(raw);
  } else if (f.transform == FileRange::Transform::stuff_lone_dots) {
    stuff_lone_dots(item, raw);
  } else {
    item.stage.clear();
    item.stage.reserve(raw.size() + raw.size() / 32);
    for (char ch : raw) {
      if (item.line_start && ch == '.') {
        if (f.transform == FileRange::Transform::dot_stuff) {
          item.stage += '.';
        } else {
          item.line_start = false;
          continue;
        }
      }
      item.stage += ch;
      item.line_start = ch == '\n';
    }
  }
  // pending_ counted the source bytes; it now counts what will be sent.
  pending_ = pending_ - static_cast<std::size_t>(n) + item.stage.size();
  return true;
}

void Connection::flush() {
  if (close_pending_) return;  // closing at once: what is queued is dropped
  while (!out_.empty() && !closed_ && transport_) {
    if (out_.front().upgrade) {
      if (!upgrade_transport()) return;
      continue;
    }
    std::string_view parts[16];
    std::size_t count = 0, total = 0;
    for (auto it = out_.begin(); it != out_.end() && count < 16 && total < 4 * kStage; ++it) {
      OutItem& item = *it;
      if (item.upgrade) break;  // sent in the clear up to here
      if (!item.is_file) {
        parts[count++] = std::string_view(item.bytes).substr(item.done);
        total += item.bytes.size() - item.done;
        continue;
      }
      if (item.done == item.stage.size() && item.file.length > 0 && !fill_stage(item)) {
        // The file cannot be read: its text instead, then the end.
        pending_ -= static_cast<std::size_t>(item.file.length) + (item.stage.size() - item.done);
        item.file.length = 0;
        item.stage = item.file.failure_text;
        item.done = 0;
        pending_ += item.stage.size();
        for (auto rest = std::next(it); rest != out_.end(); ++rest)
          pending_ -= rest->is_file ? static_cast<std::size_t>(rest->file.length) + rest->stage.size() - rest->done
                                    : rest->bytes.size() - rest->done;
        out_.erase(std::next(it), out_.end());
        after_send_reason_ = CloseReason::failed;
        if (phase_ == Phase::open) phase_ = Phase::closing;
        drop_input(in_end_ - in_start_);
      }
      parts[count++] = std::string_view(item.stage).substr(item.done);
      total += item.stage.size() - item.done;
      // One stage per write; what follows a file's last stage goes in the
      // same write, so a reply's closing line never trails in a segment of
      // its own (which the peer's delayed acknowledgement would hold up).
      if (item.file.length > 0) break;
    }
    std::size_t put = 0;
    Transport::Io io = total ? transport_->write(std::span(parts, count), put) : Transport::Io::ok;
    if (put > 0) {
      pending_ -= put;
      bytes_out_ += put;
      last_active_ = server_now;
    }
    for (std::size_t left = put; !out_.empty();) {
      OutItem& item = out_.front();
      if (item.upgrade) break;
      const std::size_t size = item.is_file ? item.stage.size() : item.bytes.size();
      std::size_t take = std::min(left, size - item.done);
      item.done += take;
      left -= take;
      if (item.done < size || (item.is_file && item.file.length > 0)) break;
      out_.pop_front();
    }
    if (io == Transport::Io::failed) {
      close_now(CloseReason::peer_reset);
      return;
    }
    if (io == Transport::Io::would_block || put < total) break;
  }
  note_fullness();
}

void Connection::read_some() {
  if (closed_ || close_pending_ || !transport_) return;
  if (tls_step_ == TlsStep::queued) return;  // read under TLS, once it has started
  if (!in_) in_ = std::make_unique<char[]>(capacity_);
  for (int i = 0; i < kReadsPerTurn; ++i) {
    if (in_start_ > 0) {  // keep the unread bytes at the front
      std::memmove(in_.get(), in_.get() + in_start_, in_end_ - in_start_);
      in_end_ -= in_start_;
      in_start_ = 0;
    }
    const std::size_t room = capacity_ - in_end_;
    if (room == 0 || peer_eof_) return;
    std::size_t got = 0;
    Transport::Io io = transport_->read(in_.get() + in_end_, room, got);
    if (io == Transport::Io::ok) {
      const char* fresh = in_.get() + in_end_;
      if (!paced_by_lines_ || std::memchr(fresh, '\n', got)) last_active_ = server_now;
      bytes_in_ += got;
      in_end_ += got;
      if (phase_ == Phase::closing) drop_input(in_end_ - in_start_);  // nobody reads it now
      dirty_ = true;
      if (got < room) return;
      continue;
    }
    if (io == Transport::Io::closed) {
      peer_eof_ = true;
      dirty_ = true;
    } else if (io == Transport::Io::failed) {
      close_now(CloseReason::peer_reset);
    }
    return;
  }
}

// Offers the input to the session while it may take it.
void Connection::deliver() {
  for (int round = 0; round < kInputRounds; ++round) {
    if (closed_ || close_pending_ || phase_ != Phase::open || !dirty_ || paused_ || was_full_ || yielded_) return;
    dirty_ = false;
    gated_ = false;
    call("input", [&](Session& s) { s.on_input(*this); });
    if (gated_) dirty_ = true;  // offered again once the gate opens
    if (peer_eof_ && !gated_ && !paused_ && !yielded_ && phase_ == Phase::open && !close_pending_) {
      // The peer has finished: what it asked for is sent, then the end.
      after_send_reason_ = CloseReason::peer_closed;
      close_after_send();
    }
    flush();
  }
}

void Connection::settle() {
  if (closed_) return;
  if (!close_pending_ && phase_ == Phase::closing && out_.empty()) {
    close_pending_ = true;
    close_reason_ = after_send_reason_;
  }
}

// ---- ConnectionCore ------------------------------------------------------------------

std::unique_ptr<Connection> ConnectionCore::make(ConnectionHost& host, std::uint64_t id, int service,
                                                 std::size_t input_capacity) {
  return std::unique_ptr<Connection>(new Connection(host, id, service, input_capacity));
}

void ConnectionCore::open(Connection& c) {
  if (c.closed_) return;
  c.phase_ = Phase::open;
  c.last_active_ = server_now;
  c.call("open", [&](Session& s) { s.on_open(c); });
  serve(c, false);
}

void ConnectionCore::serve(Connection& c, bool readable) {
  if (c.closed_) return;
  ++c.in_callback_;
  c.advance();
  c.flush();
  if (readable || (c.transport_ && c.transport_->read_ready())) c.read_some();
  c.dirty_ = c.dirty_ || (c.peer_eof_ && c.phase_ == Phase::open);
  c.deliver();
  c.flush();
  c.settle();
  --c.in_callback_;
  if (c.close_pending_ && !c.in_callback_) {
    c.finish(c.close_reason_);
    return;
  }
  // Input still waiting after this turn's rounds: another turn soon (the
  // buffer may be full, so no readiness would bring one). The same for
  // bytes a transport holds decrypted: the descriptor will not say so.
  if (c.dirty_ && c.gate_open() && !c.yielded_) c.host_.touch(c);
  else if (c.transport_ && c.transport_->read_ready() && c.transport_->needs() == Transport::Need::none &&
           wants_read(c))
    c.host_.touch(c);
}

void ConnectionCore::resume_turn(Connection& c) {
  if (!c.yielded_) return;
  c.yielded_ = false;
  c.dirty_ = true;
}

void ConnectionCore::fire_timer(Connection& c) {
  if (c.closed_) return;
  c.wake_due_ms_ = 0;
  c.call("timer", [&](Session& s) { s.on_timer(c); });
  serve(c, false);
}

bool ConnectionCore::wants_read(const Connection& c) {
  if (c.closed_ || !c.transport_) return false;
  const Transport::Need need = c.transport_->needs();
  if (need == Transport::Need::read) return true;
  if (need == Transport::Need::write || c.tls_step_ == Connection::TlsStep::queued) return false;
  if (c.phase_ == Phase::closing) return !c.peer_eof_;  // drained, so a close is not a reset
  if (c.phase_ != Phase::open || c.peer_eof_ || c.in_end_ - c.in_start_ >= c.capacity_) return false;
  return !(c.partner_ && c.partner_->was_full_);
}

bool ConnectionCore::wants_write(const Connection& c) {
  if (c.closed_ || !c.transport_) return false;
  if (c.phase_ == Phase::connecting) return true;
  switch (c.transport_->needs()) {
    case Transport::Need::write: return true;
    case Transport::Need::read: return false;  // nothing moves until the peer's bytes come
    case Transport::Need::none: break;
  }
  return !c.out_.empty();
}

}  // namespace velmor
