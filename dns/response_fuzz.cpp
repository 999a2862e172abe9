// Any datagram against a waiting lookup: the input gets the lookup's
// identifier written into its first two bytes and arrives from the server
// the lookup was sent to, so the decoding behind the checks is reached.
#include <arpa/inet.h>

#include <cstdint>
#include <vector>

#include "core/globals.h"
#include "dns/resolver.h"

namespace {

using namespace velmor::dns;

struct Net : Transport {
  std::vector<std::uint8_t> packet;
  SocketId socket = 0;
  SocketId open() override { return ++socket; }
  int send(SocketId, std::uint32_t, std::span<const std::uint8_t> p) override {
    packet.assign(p.begin(), p.end());
    return 0;
  }
  void close(SocketId) override {}
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmor::link_up = 1;
  Net net;
  std::time_t now = 1000;
  Resolver resolver(net, [&] { return now; });
  const std::uint32_t server = inet_addr("127.0.0.1");
  resolver.configure({{server}, 5, 2, "example.org"});
  // An address and a mail-exchanger lookup of the same name each get the
  // datagram, with their own identifier.
  for (int type : {1, 15}) {
    QueryId q = resolver.client_start("www.example.org", 1, type);
    std::vector<std::uint8_t> datagram(data, data + size);
    if (datagram.size() >= 2) {
      datagram[0] = net.packet[0];
      datagram[1] = net.packet[1];
    }
    resolver.receive(net.socket, server, 53, datagram);
    if (resolver.state(q) == QueryState::complete) {
      resolver.client_ipaddr(q);
      resolver.client_mx(q);
    }
  }
  // What was cached must answer without another datagram, loops included.
  resolver.client_ipaddr(resolver.client_start("www.example.org", 1, 1));
  return 0;
}
