// The resolver in the running suite: its datagram sockets on the loop, its
// start-up and tick, the address lookups of outward connections
// (connect_to waits in phase lookup for them) and of the control channel.
#pragma once

#include <cstdint>
#include <functional>
#include <string_view>
#include <vector>

#include "core/network.h"
#include "dns/resolver.h"

namespace velmor {

// Start-up: reads the dns.* keys and becomes the loop's name resolver and
// the control channel's "lookup".
void dns_register();
// Once the loop is up: sockets may open, and the link monitor's first probe
// need not wait for a tick.
void dns_start();
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
// Lets go of a lookup; one started by dns_lookup is cancelled (its `done`
// is never called).
void client_discard(QueryId id);

// An address lookup (class 1, type 1) that calls `done` once, with the
// address in network byte order or 0 when it failed. The handle of the
// lookup while it runs; 0 when it ended at once (`done` has been called).
QueryId dns_lookup(std::string_view name, std::function<void(std::uint32_t address)> done);
// A mail-exchanger lookup (class 1, type 15) with the same contract.
QueryId dns_mail_exchangers(std::string_view domain, std::function<void(MxAnswer)> done);

}  // namespace velmor
