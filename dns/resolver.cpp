// The caching resolver and the link monitor (see resolver.h).
#include "dns/resolver.h"

#include <arpa/inet.h>
#include <sys/random.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/strfmt.h"

namespace velmor::dns {

namespace {

constexpr std::uint32_t kStatusLinkNote = 0x80;  // set with "changed" when the link comes or goes
constexpr int kProbesBeforeBroken = 6;
constexpr std::time_t kProbeFor = 119;  // seconds of probing after the link was declared broken

bool debugging() { return (log_mask & logfac::dns) != 0; }
void debug(std::string_view text, std::string_view value = {}) {
  if (debugging()) log_message(text, value, logfac::dns);
}

std::string address_text(std::uint32_t address_nbo) {
  in_addr a{};
  a.s_addr = address_nbo;
  char text[INET_ADDRSTRLEN] = {};
  return inet_ntop(AF_INET, &a, text, sizeof text) ? text : "";
}

// Only four dotted decimal parts make an address: "163.com" is a name.
std::optional<std::uint32_t> dotted_quad(std::string_view name) {
  if (name.size() > 15 || name.empty() || name[0] < '0' || name[0] > '9') return std::nullopt;
  std::string text(name);
  in_addr a{};
  if (inet_pton(AF_INET, text.c_str(), &a) != 1 || a.s_addr == 0) return std::nullopt;
  return a.s_addr;
}

std::optional<std::uint16_t> random_id() {
  std::uint16_t id = 0;
  for (int tries = 0; tries < 8; ++tries) {
    if (getrandom(&id, sizeof id, 0) == static_cast<ssize_t>(sizeof id)) return id;
    if (errno != EINTR) break;
  }
  return std::nullopt;
}

bool class_matches(std::uint16_t asked, std::uint16_t rclass) { return asked == kClassAny || asked == rclass; }

}  // namespace

std::vector<std::uint32_t> parse_servers(std::string_view text) {
  std::vector<std::uint32_t> servers;
  while (!text.empty() && servers.size() < 3) {
    std::size_t comma = text.find(',');
    std::string_view item = text.substr(0, comma);
    text = comma == std::string_view::npos ? std::string_view() : text.substr(comma + 1);
    while (!item.empty() && (item.front() == ' ' || item.front() == '\t')) item.remove_prefix(1);
    while (!item.empty() && (item.back() == ' ' || item.back() == '\t' || item.back() == '\r' || item.back() == '\n'))
      item.remove_suffix(1);
    if (auto address = dotted_quad(item)) servers.push_back(*address);
  }
  return servers;
}

Resolver::Resolver(Transport& transport, Clock clock) : transport_(transport), clock_(std::move(clock)) {}

Resolver::~Resolver() { clear(); }

void Resolver::configure(Settings settings) {
  if (settings.servers.size() > 3) settings.servers.resize(3);
  settings_ = std::move(settings);
}

Resolver::Query* Resolver::find(QueryId id) {
  auto it = queries_.find(id);
  return it == queries_.end() ? nullptr : &it->second;
}

const Resolver::Query* Resolver::find(QueryId id) const {
  auto it = queries_.find(id);
  return it == queries_.end() ? nullptr : &it->second;
}

std::size_t Resolver::waiting() const {
  return static_cast<std::size_t>(std::count_if(queries_.begin(), queries_.end(), [](const auto& e) {
    return e.second.kind == Kind::lookup && e.second.state == QueryState::waiting;
  }));
}

// ---- starting a lookup ---------------------------------------------------------

QueryId Resolver::client_start(std::string_view name, int qclass, int qtype) {
  if (name.empty() || qclass < 0 || qclass > 0xffff || qtype < 0 || qtype > 0xffff) return 0;
  // A new lookup wants to know about the link again.
  broken_at_ = 0;
  const QueryId qid = next_query_++;
  Query& q = queries_[qid];
  q.kind = Kind::lookup;
  q.name = std::string(without_final_dot(name));
  q.may_search = name.find('.') == std::string_view::npos;
  q.qclass = static_cast<std::uint16_t>(qclass == 0 ? kClassAny : qclass);
  q.qtype = static_cast<std::uint16_t>(qtype == 0 ? rrtype::any : qtype);
  q.created = now();
  if (debugging())
    debug(strprintf("client_start - addr:%s, class:%d, type:%d", q.name.c_str(), q.qclass, q.qtype));

  if (q.qtype == rrtype::a) {
    if (auto address = dotted_quad(q.name)) {
      q.answers.push_back({q.name, rrtype::a, kClassIn, 0, 0, std::string(reinterpret_cast<const char*>(&*address), 4)});
      q.state = QueryState::complete;
      return qid;
    }
  }
  if (!link_up) {
    q.state = QueryState::failed;
    return qid;
  }
  if (cache_answers(q)) {
    debug("domain in cache");
    return qid;
  }
  if (q.state == QueryState::failed) return qid;
  q.socket = transport_.open();
  if (q.socket == 0 || !prepare_query(qid, q) || !transmit(q)) {
    finish(qid, q, QueryState::failed, false);
    return qid;
  }
  by_socket_[q.socket] = qid;
  q.state = QueryState::waiting;
  return qid;
}

// The cache answers when the chain from the name (8 CNAMEs at most) ends in
// unexpired records of the asked type. A name without a dot is looked for
// with the search domain too, as the wire lookup would ask it.
bool Resolver::cache_answers(Query& q) {
  const std::time_t t = now();
  std::string current = q.name;
  std::vector<std::string> seen{name_key(current)};
  bool tried_search = false;
  q.answers.clear();
  for (;;) {
    std::vector<CachedRecord> records = cache_.find(current, t);
    if (records.empty()) {
      if (seen.size() == 1 && !tried_search && q.may_search && !settings_.search.empty()) {
        tried_search = true;
        current = q.name + "." + settings_.search;
        seen = {name_key(current)};
        continue;
      }
      q.answers.clear();
      return false;
    }
    if (seen.size() == 1 && tried_search) {
      q.name = current;
      q.searched = true;
    }
    auto copy = [&](const CachedRecord& r) {
      q.answers.push_back({current, r.type, r.rclass, static_cast<std::uint32_t>(r.expires - t), r.preference, r.data});
    };
    if (q.qtype != rrtype::any && q.qtype != rrtype::cname) {
      auto cname = std::find_if(records.begin(), records.end(), [&](const CachedRecord& r) {
        return r.type == rrtype::cname && class_matches(q.qclass, r.rclass);
      });
      if (cname != records.end()) {
        copy(*cname);
        std::string next = name_key(cname->data);
        if (seen.size() > static_cast<std::size_t>(kMaxCnameLinks) ||
            std::find(seen.begin(), seen.end(), next) != seen.end()) {
          debug("client_ipaddr: bad record decode:", q.name);
          q.answers.clear();
          q.state = QueryState::failed;
          return false;
        }
        seen.push_back(next);
        current = cname->data;
        continue;
      }
    }
    bool found = false;
    for (const CachedRecord& r : records) {
      if (!class_matches(q.qclass, r.rclass) || (q.qtype != rrtype::any && r.type != q.qtype)) continue;
      copy(r);
      found = true;
    }
    if (!found) {
      q.answers.clear();
      return false;
    }
    q.state = QueryState::complete;
    return true;
  }
}

bool Resolver::prepare_query(QueryId qid, Query& q) {
  release_id(q);
  std::optional<std::uint16_t> id;
  for (int tries = 0; tries < 64 && !id; ++tries) {
    id = random_id();
    if (!id) return false;
    if (ids_.count(*id)) id.reset();
  }
  if (!id) return false;
  if (debugging())
    debug(strprintf("Calling res_mkquery:addr:%s, class:%d, type:%d", q.name.c_str(), q.qclass, q.qtype));
  auto packet = build_query(*id, q.name, q.qtype, q.qclass);
  if (!packet) {
    debug("res_mkquery failed");
    return false;
  }
  Header h;
  std::vector<Question> questions;
  if (decode(*packet, h, questions, nullptr) != DecodeResult::ok || questions.size() != 1) return false;
  q.question = questions[0].name;
  q.packet = std::move(*packet);
  q.id = *id;
  q.has_id = true;
  ids_[*id] = qid;
  q.retries = 0;
  q.server_index = 0;
  q.sent_to.clear();
  if (debugging()) debug(strprintf("res_mkquery OK, id:%d, len:%d", q.id, static_cast<int>(q.packet.size())));
  return true;
}

bool Resolver::transmit(Query& q) {
  const auto& servers = settings_.servers;
  if (servers.empty()) return false;
  if (q.server_index >= servers.size()) {
    ++q.retries;
    q.server_index = 0;
  }
  if (q.retries >= settings_.retries) return false;
  const std::uint32_t server = servers[q.server_index++];
  if (debugging()) debug(strprintf("querying :id:%d, retries:%d", q.id, q.retries));
  int error = transport_.send(q.socket, server, q.packet);
  if (error != 0 || debugging())
    log_message(strprintf("client_sendquery - sent, addr:%x, port:%d, len:%d, errno:%d", ntohl(server), 53,
                          static_cast<int>(q.packet.size()), error),
                {}, logfac::dns);
  if (std::find(q.sent_to.begin(), q.sent_to.end(), server) == q.sent_to.end()) q.sent_to.push_back(server);
  q.last_sent = now();
  return true;
}

void Resolver::release_id(Query& q) {
  if (!q.has_id) return;
  auto it = ids_.find(q.id);
  if (it != ids_.end() && queries_.count(it->second) && &queries_.at(it->second) == &q) ids_.erase(it);
  q.has_id = false;
}

void Resolver::finish(QueryId qid, Query& q, QueryState end, bool notify) {
  release_id(q);
  if (q.socket != 0) {
    by_socket_.erase(q.socket);
    transport_.close(q.socket);
    q.socket = 0;
  }
  q.state = end;
  if (end == QueryState::failed && q.failure == Failure::none) q.failure = Failure::no_answer;
  if (notify && q.kind == Kind::lookup) ended_.emplace_back(qid, end);
}

void Resolver::notify_ended() {
  while (!ended_.empty()) {
    auto ended = std::move(ended_);
    ended_.clear();
    for (auto [qid, end] : ended)
      if (on_end_ && queries_.count(qid)) on_end_(qid, end);
  }
}

// ---- reading a finished lookup ---------------------------------------------------------

QueryState Resolver::state(QueryId id) const {
  const Query* q = find(id);
  return q ? q->state : QueryState::failed;
}

Failure Resolver::failure(QueryId id) const {
  const Query* q = find(id);
  if (!q) return Failure::no_answer;
  if (q->state != QueryState::failed) return Failure::none;
  return q->failure == Failure::none ? Failure::no_answer : q->failure;
}

const std::vector<Answer>* Resolver::answers(QueryId id) const {
  const Query* q = find(id);
  return q ? &q->answers : nullptr;
}

std::string Resolver::answered_name(QueryId id) const {
  const Query* q = find(id);
  return q ? q->name : std::string();
}

namespace {

// The last name of the CNAME chain from `name` through `answers`; nullopt
// for a chain longer than the limit (a loop is one).
std::optional<std::string> chain_end(const std::vector<Answer>& answers, std::string name) {
  for (int links = 0;; ++links) {
    auto cname = std::find_if(answers.begin(), answers.end(), [&](const Answer& a) {
      return a.type == rrtype::cname && same_name(a.name, name);
    });
    if (cname == answers.end()) return name;
    if (links == kMaxCnameLinks) return std::nullopt;
    name = cname->data;
  }
}

}  // namespace

std::uint32_t Resolver::client_ipaddr(QueryId id) const {
  const Query* q = find(id);
  if (!q || q->state != QueryState::complete || q->answers.empty() || q->name.empty()) return 0;
  if (auto end = chain_end(q->answers, q->name)) {
    for (const Answer& a : q->answers) {
      if (a.type == rrtype::a && a.data.size() == 4 && same_name(a.name, *end)) {
        std::uint32_t address;
        std::memcpy(&address, a.data.data(), 4);
        if (debugging()) debug(strprintf("client_ipaddr:id:%d addr:%s", q->id, address_text(address).c_str()));
        return address;
      }
    }
  }
  debug("client_ipaddr: bad record decode:", q->name);
  return 0;
}

std::vector<MxHost> Resolver::client_mx(QueryId id) const {
  std::vector<MxHost> hosts;
  const Query* q = find(id);
  if (!q || q->state != QueryState::complete) return hosts;
  auto end = chain_end(q->answers, q->name);
  if (!end) return hosts;
  for (const Answer& a : q->answers)
    if (a.type == rrtype::mx && same_name(a.name, *end)) hosts.push_back({a.preference, a.data});
  std::stable_sort(hosts.begin(), hosts.end(),
                   [](const MxHost& a, const MxHost& b) { return a.preference < b.preference; });
  return hosts;
}

void Resolver::client_discard(QueryId id) {
  Query* q = find(id);
  if (!q) return;
  if (debugging()) debug(strprintf("client_discard: id:%d", q->id));
  finish(id, *q, q->state == QueryState::waiting ? QueryState::failed : q->state, false);
  queries_.erase(id);
}

void Resolver::clear() {
  for (auto& [qid, q] : queries_)
    if (q.socket != 0) transport_.close(q.socket);
  queries_.clear();
  by_socket_.clear();
  ids_.clear();
  ended_.clear();
}

// ---- answers ---------------------------------------------------------------------------

void Resolver::receive(SocketId socket, std::uint32_t source, std::uint16_t port,
                       std::span<const std::uint8_t> data) {
  if (data.size() > kMaxDatagram) {
    debug("Datagram too large, dropped");
    return;
  }
  Header h;
  if (!decode_header(data, h)) return;
  if (debugging())
    debug(strprintf("recv %d: rc:%d qr:%d tc:%d id:%d op:%d rd:%d qd:%d an:%d ns:%d ar:%d",
                    static_cast<int>(data.size()), h.rcode, h.qr, h.tc, h.id, h.opcode, h.rd, h.qdcount,
                    h.ancount, h.nscount, h.arcount));
  if (!h.qr) return;  // a query: the suite answers none
  auto owner = by_socket_.find(socket);
  Query* found = owner == by_socket_.end() ? nullptr : find(owner->second);
  // Only the server a query went to, from its port 53, with the query's
  // identifier: anything else is somebody guessing.
  if (!found || port != 53 || h.id != found->id || !found->has_id ||
      std::find(found->sent_to.begin(), found->sent_to.end(), source) == found->sent_to.end()) {
    debug("Received unknown id");
    return;
  }
  const QueryId qid = owner->second;
  Query& q = *found;
  if (q.state != QueryState::waiting) {
    debug("Query already answered");
    return;
  }
  std::vector<Question> questions;
  if (h.opcode != 0 || decode(data, h, questions, nullptr) != DecodeResult::ok || questions.size() != 1 ||
      !same_name(questions[0].name, q.question) || questions[0].type != q.qtype ||
      questions[0].qclass != q.qclass) {
    debug("Bad reply");
    return;
  }
  link_proved();
  if (q.kind == Kind::probe) {
    finish(qid, q, QueryState::complete, false);
    queries_.erase(qid);
    return;
  }
  if (h.tc) return;  // nothing usable; the query is resent or times out
  if (h.rcode == rcode::name_error) {
    if (q.may_search && !q.searched && !settings_.search.empty()) {
      q.searched = true;
      q.name += "." + settings_.search;
      debug("adding search:", q.name);
      if (!prepare_query(qid, q) || !transmit(q)) finish(qid, q, QueryState::failed, true);
    } else {
      q.failure = Failure::no_such_name;
      finish(qid, q, QueryState::failed, true);
    }
    notify_ended();
    return;
  }
  if (h.rcode != rcode::no_error) {
    debug("Bad reply");  // another server may do better: resent at the time-out
    return;
  }
  std::vector<Record> records;
  DecodeResult result = decode(data, h, questions, &records);
  if (result != DecodeResult::ok) {
    debug(result == DecodeResult::bad_name ? "Bad DNS name expansion:" : "Bad record expand:", q.name);
    return;
  }
  take_answer(qid, q, records);
  notify_ended();
}

// Keeps the answer-section records on the chain from the question: the
// CNAMEs (8 at most) and the asked type (any type for 255). The lookup is
// complete when the chain ends in a record of the asked type.
void Resolver::take_answer(QueryId qid, Query& q, const std::vector<Record>& records) {
  const bool follow = q.qtype != rrtype::cname && q.qtype != rrtype::any;
  std::string current = q.question;
  std::vector<std::string> chain{name_key(current)};
  auto on_chain = [&](const std::string& name) {
    return std::find(chain.begin(), chain.end(), name_key(name)) != chain.end();
  };
  while (follow) {
    auto cname = std::find_if(records.begin(), records.end(), [&](const Record& r) {
      return r.section == Section::answer && r.type == rrtype::cname && class_matches(q.qclass, r.rclass) &&
             same_name(r.name, current);
    });
    if (cname == records.end()) break;
    if (chain.size() > static_cast<std::size_t>(kMaxCnameLinks) || on_chain(cname->data)) {
      debug("client_ipaddr: bad record decode:", q.name);
      finish(qid, q, QueryState::failed, true);
      return;
    }
    current = cname->data;
    chain.push_back(name_key(current));
  }
  std::vector<Record> kept;
  bool found = false;
  for (const Record& r : records) {
    if (r.section != Section::answer || !class_matches(q.qclass, r.rclass) || !on_chain(r.name)) continue;
    const bool asked = q.qtype == rrtype::any || r.type == q.qtype;
    if (!asked && !(follow && r.type == rrtype::cname)) continue;
    kept.push_back(r);
    if (asked && same_name(r.name, current)) found = true;
  }
  if (!found) {
    q.failure = Failure::no_records;
    finish(qid, q, QueryState::failed, true);
    return;
  }
  cache_.store(kept, now());
  q.answers.clear();
  for (const Record& r : kept) q.answers.push_back({r.name, r.type, r.rclass, r.ttl, r.preference, r.data});
  debug("all done, dropping to `complete' state");
  finish(qid, q, QueryState::complete, true);
}

// ---- time: resends, time-outs and the link monitor -------------------------------------

void Resolver::fail_waiting() {
  for (auto& [qid, q] : queries_)
    if (q.kind == Kind::lookup && q.state == QueryState::waiting) finish(qid, q, QueryState::failed, true);
}

void Resolver::poll() {
  const std::time_t t = now();
  const int timeout = std::max(settings_.timeout, 1);
  if (!link_up) fail_waiting();
  std::vector<QueryId> stale_probes;
  for (auto& [qid, q] : queries_) {
    if (q.state != QueryState::waiting) continue;
    if (q.kind == Kind::probe) {
      if (t - q.created >= timeout) stale_probes.push_back(qid);
      continue;
    }
    if (t < q.last_sent + timeout) continue;
    if (!transmit(q)) {
      link_probe_due = 1;
      probe_count_ = 0;
      log_message(strprintf("query_poll - timedout, id:%d", q.id), {}, logfac::dns);
      finish(qid, q, QueryState::failed, true);
    }
  }
  for (QueryId qid : stale_probes) client_discard(qid);
  if (!link_up || link_probe_due) monitor();
  notify_ended();
}

void Resolver::monitor() {
  const std::time_t t = now();
  if (t <= last_probe_) return;  // once a second
  if (broken_at_ != 0 && t - broken_at_ > kProbeFor) return;
  const auto& servers = settings_.servers;
  if (servers.empty()) return;
  if (link_up && link_probe_due && ++probe_count_ > kProbesBeforeBroken) {
    link_broken();
    if (hooks.link_watch) hooks.link_watch();  // a dialler on line may hang up now
    return;
  }
  last_probe_ = t;
  const std::uint32_t server = servers[next_probe_server_++ % servers.size()];
  const auto* b = reinterpret_cast<const unsigned char*>(&server);
  const QueryId qid = next_query_++;
  Query& p = queries_[qid];
  p.kind = Kind::probe;
  p.name = strprintf("%d.%d.%d.%d.in-addr.arpa", b[3], b[2], b[1], b[0]);
  p.qtype = rrtype::ptr;
  p.created = t;
  p.socket = transport_.open();
  if (p.socket == 0 || !prepare_query(qid, p)) {
    finish(qid, p, QueryState::failed, false);
    queries_.erase(qid);
    return;
  }
  by_socket_[p.socket] = qid;
  int error = transport_.send(p.socket, server, p.packet);
  p.sent_to = {server};
  p.last_sent = t;
  p.state = QueryState::waiting;
  debug("Ping send:", std::to_string(error));
  if (hooks.link_watch) hooks.link_watch();
}

void Resolver::link_proved() {
  probe_count_ = 0;
  if (link_up) {
    link_probe_due = 0;
    return;
  }
  if (hooks.link_watch) hooks.link_watch();
  log_message("DNS - Network link established");
  link_up = 1;
  link_probe_due = 0;
  broken_at_ = 0;
  if (!(status_bits & status::link_established))
    status_bits |= status::link_established | kStatusLinkNote | status::changed;
  if (mail_transfer_state == 1) mail_transfer_state = 5;  // the transfer waiting for the link goes on
}

void Resolver::link_broken() {
  log_message("DNS - Network link broken");
  link_up = 0;
  link_probe_due = 0;
  broken_at_ = now();
  if (status_bits & status::link_established) {
    status_bits &= ~status::link_established;
    status_bits |= kStatusLinkNote | status::changed;
  }
  fail_waiting();
}

}  // namespace velmor::dns
