// The caching resolver and the link monitor, as an engine that knows no
// sockets: the clock and the datagram transport are handed in, and the
// engine is told of every datagram that arrives. dns/service.cpp binds it to
// the suite's dispatcher; the unit tests drive it with a settable clock.
//
// A lookup (client_start) is answered from the cache, or sent at once from
// a socket of its own to the configured servers in turn, one transmission
// every `timeout` seconds for `retries` passes over the list. An answer
// counts only when it comes from port 53 of a server the query was sent
// to, on the query's own socket, with the query's identifier (random, never
// shared by two waiting queries or probes), and repeats the question.
//
// The link: any such answer proves the link up (`link_up`, status bit
// 0x10000, and a mail transfer waiting for the link moves on). A query that
// times out asks for probes (`link_probe_due`); six unanswered probes,
// one a second, declare the link broken, which fails the lookups still
// waiting. While the link is down probes go on once a second, and stop two
// minutes after it was declared broken until a new lookup starts.
#pragma once

#include <cstdint>
#include <ctime>
#include <functional>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "dns/cache.h"
#include "dns/message.h"

namespace velmor::dns {

// Handles of the transport's sockets; 0 is none. Never reused.
using SocketId = std::uint64_t;
// Handles of lookups; 0 is none. Never reused, so a handle kept too long
// finds nothing rather than somebody else's lookup.
using QueryId = std::uint64_t;

class Transport {
 public:
  virtual ~Transport() = default;
  // A fresh UDP socket on an ephemeral port; 0 when none can be had.
  virtual SocketId open() = 0;
  // Sends `packet` to port 53 of `server` (network byte order). 0, or the
  // error number (the query is then retried as if the datagram were lost).
  virtual int send(SocketId socket, std::uint32_t server, std::span<const std::uint8_t> packet) = 0;
  virtual void close(SocketId socket) = 0;
};

struct Settings {
  std::vector<std::uint32_t> servers;  // network byte order, at most 3
  int timeout = 0;                     // seconds between transmissions
  int retries = 0;                     // passes over the server list
  std::string search;                  // tried once for a name without a dot
};
// `dns.servers` text: comma-separated dotted quads, blanks allowed; items
// that do not begin with a digit or do not parse are skipped; 3 at most.
std::vector<std::uint32_t> parse_servers(std::string_view text);

enum class QueryState { started = 1, waiting = 2, failed = 3, complete = 4 };

// Why a lookup failed: what a mail route needs to tell a domain that does
// not exist (its mail goes back at once) from one without records of the
// asked type and from a server that did not answer (try again later).
enum class Failure { none, no_such_name, no_records, no_answer };

// One answer record kept on a finished lookup: the records of the chain
// from the question (CNAMEs and the asked type).
struct Answer {
  std::string name;
  std::uint16_t type = 0;
  std::uint16_t rclass = 0;
  std::uint32_t ttl = 0;
  std::uint16_t preference = 0;  // MX
  std::string data;              // A: 4 bytes; name types: the name; else raw
};

struct MxHost {
  std::uint16_t preference = 0;
  std::string host;
};

// The longest CNAME chain followed; a loop or a longer chain fails.
inline constexpr int kMaxCnameLinks = 8;

class Resolver {
 public:
  using Clock = std::function<std::time_t()>;
  // Told when a waiting lookup ends (failed or complete). Not called for a
  // lookup that ends inside client_start: read its state there. The handler
  // may discard the lookup or start others.
  using EndHandler = std::function<void(QueryId, QueryState)>;

  Resolver(Transport& transport, Clock clock);
  ~Resolver();
  Resolver(const Resolver&) = delete;
  Resolver& operator=(const Resolver&) = delete;

  void configure(Settings settings);
  const Settings& settings() const { return settings_; }
  void on_end(EndHandler handler) { on_end_ = std::move(handler); }

  // Starts a lookup; class and type 0 mean 255 (any). Returns 0 for an empty
  // name. A dotted quad asked as an address completes at once (even while
  // the link is down), so does a name the cache answers while the link is
  // up; a lookup that cannot be sent (link down, no server, no socket, a name
  // that cannot be encoded) fails at once. Otherwise its first datagram
  // leaves now and it waits.
  QueryId client_start(std::string_view name, int qclass, int qtype);
  // The lookup's state; failed for an unknown handle.
  QueryState state(QueryId id) const;
  // Why a failed lookup failed (none while it has not failed).
  Failure failure(QueryId id) const;
  // The IPv4 address (network byte order) of a complete lookup, following
  // its CNAMEs (8 at most); 0 when there is none.
  std::uint32_t client_ipaddr(QueryId id) const;
  // The mail exchangers of a complete type-15 lookup, lowest preference first.
  std::vector<MxHost> client_mx(QueryId id) const;
  const std::vector<Answer>* answers(QueryId id) const;
  // The name the answers belong to (the search domain appended when it was).
  std::string answered_name(QueryId id) const;
  // Forgets the lookup (closing its socket if it still waits).
  void client_discard(QueryId id);

  // A datagram arrived on `socket` from `source`:`port` (address in
  // network byte order).
  void receive(SocketId socket, std::uint32_t source, std::uint16_t port, std::span<const std::uint8_t> data);
  // Resends what is due, times lookups out, fails waiting lookups while the
  // link is down, and runs the link monitor while the link is down or a
  // probe is due. Called every main-loop tick.
  void poll();
  // The dialler's script has ended: forget when the link was declared
  // broken, so probing starts at once.
  void restart_probing() { broken_at_ = 0; }
  // The dialler has hung up: the link is to be proved again, and two probes
  // count as already unanswered.
  void hung_up() { probe_count_ = 2; }

  // Every lookup and probe, ending all sockets (shutdown).
  void clear();
  std::size_t waiting() const;
  Cache& cache() { return cache_; }

 private:
  enum class Kind { lookup, probe };
  struct Query {
    Kind kind = Kind::lookup;
    QueryState state = QueryState::started;
    std::string name;      // the name asked now (the search domain appended when it was)
    std::string question;  // the question as our own packet carries it
    bool may_search = false;
    bool searched = false;
    std::uint16_t qclass = kClassIn;
    std::uint16_t qtype = rrtype::a;
    std::vector<std::uint8_t> packet;
    std::uint16_t id = 0;
    bool has_id = false;
    SocketId socket = 0;
    std::vector<std::uint32_t> sent_to;
    std::time_t last_sent = 0;
    std::time_t created = 0;
    int retries = 0;
    std::size_t server_index = 0;
    std::vector<Answer> answers;
    Failure failure = Failure::none;
  };

  std::time_t now() const { return clock_(); }
  Query* find(QueryId id);
  const Query* find(QueryId id) const;
  bool cache_answers(Query& q);
  bool prepare_query(QueryId qid, Query& q);  // a fresh identifier and packet for q.name
  bool transmit(Query& q);                // the next transmission; false when used up
  void finish(QueryId id, Query& q, QueryState state, bool notify);
  void release_id(Query& q);
  void take_answer(QueryId id, Query& q, const std::vector<Record>& records);
  void link_proved();
  void link_broken();
  void monitor();
  void fail_waiting();
  void notify_ended();

  Transport& transport_;
  Clock clock_;
  Settings settings_;
  EndHandler on_end_;
  Cache cache_;
  std::map<QueryId, Query> queries_;
  std::unordered_map<SocketId, QueryId> by_socket_;
  std::unordered_map<std::uint16_t, QueryId> ids_;
  std::vector<std::pair<QueryId, QueryState>> ended_;
  QueryId next_query_ = 1;
  int probe_count_ = 0;
  std::time_t broken_at_ = 0;  // when the link was declared broken (0 none)
  std::time_t last_probe_ = 0;
  std::size_t next_probe_server_ = 0;
};

}  // namespace velmor::dns
