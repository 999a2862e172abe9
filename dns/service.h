// The resolver in the running suite: service 100, its start-up and tick,
// and the lookups that services and the control channel start.
//
// A service that must reach a host puts its record in state 80 with
// record_lookup_start(); the dispatcher then calls the service's lookup_done
// or lookup_failed handler, where it reads the result (client_ipaddr(
// record_lookup(record)), or client_mx for mail exchangers) and lets go of
// it with record_lookup_discard(). A lookup belongs to its record: when the
// record closes, the lookup is dropped, and its end never reaches another
// record that reuses the descriptor.
#pragma once

#include <cstdint>
#include <functional>
#include <string_view>
#include <vector>

#include "dns/resolver.h"

namespace velmor {

struct SocketRecord;

// Start-up: registers service 100 (its sockets come with open_sockets) and
// reads the dns.* keys.
void dns_init();
// Every main-loop tick: resends, time-outs, the link monitor.
void dns_poll();
// Drops every lookup and closes the resolver's sockets.
void dns_shutdown();
dns::Resolver& dns_resolver();

// The lookup query interface (handles are never reused; 0 is none).
using dns::QueryId;
QueryId client_start(std::string_view name, int qclass, int qtype);
dns::QueryState query_state(QueryId id);
std::uint32_t client_ipaddr(QueryId id);  // network byte order; 0 = none
std::vector<dns::MxHost> client_mx(QueryId id);
void client_discard(QueryId id);

// Starts the lookup of `name` for `record` and puts the record in state 80.
// A lookup that ends at once (a dotted quad, the cache) is handed to the
// dispatcher's next pass like any other. false when no lookup could be made.
bool record_lookup_start(SocketRecord& record, std::string_view name, int qclass = 1, int qtype = 1);
QueryId record_lookup(const SocketRecord& record);  // 0 when the record has none
void record_lookup_discard(SocketRecord& record);

// An address lookup (class 1, type 1) that calls `done` once, with the
// address in network byte order or 0 when it failed.
void dns_lookup(std::string_view name, std::function<void(std::uint32_t address)> done);

}  // namespace velmor
