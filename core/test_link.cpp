#include "core/test_link.h"

#include <arpa/inet.h>

#include <stdexcept>
#include <utility>

#include "core/config.h"
#include "core/network.h"

namespace velmor {

namespace {

// Far above the loop's own ids, so marks keyed by id never meet.
std::uint64_t next_test_id() {
  static std::uint64_t id = std::uint64_t{1} << 48;
  return ++id;
}

Peer loopback_peer() { return Peer{htonl(0x7f000001), 40000, "127.0.0.1"}; }

}  // namespace

Transport::Io TestLink::Memory::read(char* to, std::size_t room, std::size_t& got) {
  got = 0;
  if (link.reset_) return Io::failed;
  if (link.from_peer_.empty()) return link.eof_ ? Io::closed : Io::would_block;
  got = std::min(room, link.from_peer_.size());
  link.from_peer_.copy(to, got);
  link.from_peer_.erase(0, got);
  return Io::ok;
}

Transport::Io TestLink::Memory::write(std::span<const std::string_view> parts, std::size_t& put) {
  put = 0;
  if (link.reset_) return Io::failed;
  ++link.writes_;
  for (std::string_view p : parts) {
    std::size_t n = std::min(p.size(), link.window_);
    link.to_peer_.append(p.substr(0, n));
    link.window_ -= n;
    put += n;
    if (n < p.size()) return put ? Io::ok : Io::would_block;
  }
  return Io::ok;
}

TestLink::TestLink(int service, Peer peer) {
  const ServiceDescriptor* desc = service_find(service);
  if (!desc) throw std::logic_error("TestLink: service not registered");
  connection_ = ConnectionCore::make(*this, next_test_id(), service, static_cast<std::size_t>(socket_buffer_size()));
  begin(std::move(peer));
  start_accepted(*connection_, *desc);
  settle();
}

TestLink::TestLink(std::unique_ptr<Session> session, std::size_t input_capacity, Peer peer) {
  connection_ = ConnectionCore::make(*this, next_test_id(), 0, input_capacity);
  begin(std::move(peer));
  ConnectionCore::set_session(*connection_, std::move(session));
  ConnectionCore::open(*connection_);
  settle();
}

void TestLink::begin(Peer peer) {
  if (peer.text.empty()) peer = loopback_peer();
  ConnectionCore::set_transport(*connection_, std::make_unique<Memory>(*this), -1);
  ConnectionCore::set_peer(*connection_, std::move(peer));
}

TestLink::~TestLink() {
  if (!connection_->closed()) connection_->close_now(CloseReason::shutdown);
}

void TestLink::release(Connection& c) { reason_ = ConnectionCore::close_reason(c); }

// Turns while the connection can take what the peer sent (the loop would
// be told "readable" again and again).
void TestLink::pump() {
  Connection& c = *connection_;
  ConnectionCore::serve(c, true);
  while (!c.closed() && ConnectionCore::wants_read(c) && (!from_peer_.empty() || eof_ || reset_)) {
    const std::size_t before = from_peer_.size();
    ConnectionCore::serve(c, true);
    if (from_peer_.size() == before && !reset_) break;  // eof already seen
  }
}

// What the end of a pass does: the after-pass hooks, then turns for what
// they (or anything outside the connection's own turn) changed.
void TestLink::settle() {
  for (int round = 0; round < 64; ++round) {
    run_after_pass();
    if (!touched_ || connection_->closed()) break;
    touched_ = false;
    pump();
  }
  while (!hold_passes_ && pass()) {
  }
}

bool TestLink::pass() {
  if (!yielded_ || connection_->closed()) return false;
  yielded_ = false;
  ConnectionCore::resume_turn(*connection_);
  const bool held = std::exchange(hold_passes_, true);  // one pass, not the ones it asks for
  pump();
  settle();
  hold_passes_ = held;
  return true;
}

void TestLink::feed(std::string_view bytes, std::size_t piece) {
  if (piece == 0) piece = bytes.size() ? bytes.size() : 1;
  for (std::size_t at = 0; at < bytes.size(); at += piece) {
    from_peer_.append(bytes.substr(at, piece));
    pump();
    settle();
  }
}

void TestLink::finish() {
  eof_ = true;
  pump();
  settle();
}

void TestLink::vanish() {
  reset_ = true;
  pump();
  settle();
}

std::string TestLink::take() {
  std::string fresh = to_peer_.substr(taken_);
  taken_ = to_peer_.size();
  return fresh;
}

void TestLink::peer_window(std::size_t bytes) {
  window_ = bytes;
  turn();
}

void TestLink::turn() {
  pump();
  settle();
}

void TestLink::advance(std::chrono::milliseconds by) {
  now_ms_ += by.count();
  while (due_ != 0 && due_ <= now_ms_ && !connection_->closed()) {
    due_ = 0;
    ConnectionCore::fire_timer(*connection_);
    settle();
  }
}

}  // namespace velmor
