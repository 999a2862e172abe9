// The suite's resolver under load: the dns/ engine and its binding to the
// event loop, as the daemon runs them, resolving every name of a file with
// OUTSTANDING lookups in flight, starting with an empty cache; then the
// names the cache keeps (the last 10,000) again from the cache.
//
//   dns_bench SERVER NAMES_FILE [OUTSTANDING]
//
// Prints "cold: N lookups, F failed, S s, R lookups/s" and the same for the
// cached pass.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <fstream>
#include <string>
#include <vector>

#include "core/config.h"
#include "core/globals.h"
#include "core/network.h"
#include "dns/service.h"

using namespace velmor;

namespace {

double seconds_since(std::chrono::steady_clock::time_point start) {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// One pass of the loop, and the resolver's tick every half second.
void turn(std::chrono::steady_clock::time_point& next_tick) {
  server_now = std::time(nullptr);
  net_pass(5);
  if (std::chrono::steady_clock::now() >= next_tick) {
    server_now = std::time(nullptr);
    dns_poll();
    next_tick += std::chrono::milliseconds(500);
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 3) {
    std::fprintf(stderr, "usage: dns_bench SERVER NAMES_FILE [OUTSTANDING]\n");
    return 2;
  }
  const std::size_t outstanding = argc > 3 ? std::strtoul(argv[3], nullptr, 10) : 100;
  std::vector<std::string> names;
  std::ifstream in(argv[2]);
  for (std::string line; std::getline(in, line);)
    if (!line.empty()) names.push_back(line.substr(0, line.find(' ')));

  config.dns_servers = argv[1];
  config.dns_timeout = 5;
  config.dns_retries = 2;
  server_now = std::time(nullptr);
  dns_register();
  dns_start();
  auto next_tick = std::chrono::steady_clock::now();
  const auto wait_start = std::chrono::steady_clock::now();
  while (!link_up) {
    if (seconds_since(wait_start) > 10) {
      std::fprintf(stderr, "dns_bench: no answer from %s\n", argv[1]);
      return 1;
    }
    turn(next_tick);
  }

  std::size_t started = 0, done = 0, failed = 0;
  const auto start = std::chrono::steady_clock::now();
  while (done < names.size()) {
    while (started < names.size() && started - done < outstanding)
      dns_lookup(names[started++], [&](std::uint32_t address) {
        ++done;
        if (address == 0) ++failed;
      });
    turn(next_tick);
  }
  double cold = seconds_since(start);
  std::printf("cold: %zu lookups, %zu failed, %.3f s, %.0f lookups/s\n", names.size(), failed, cold,
              names.size() / cold);

  // The cache keeps the 10,000 names used last: ask those again, three times.
  const std::size_t first = names.size() > dns::kCacheNames ? names.size() - dns::kCacheNames : 0;
  std::size_t cached_failed = 0, cached_count = 0;
  const auto cached_start = std::chrono::steady_clock::now();
  for (int round = 0; round < 3; ++round)
    for (std::size_t i = first; i < names.size(); ++i, ++cached_count)
      dns_lookup(names[i], [&](std::uint32_t address) { cached_failed += address == 0; });
  double cached = seconds_since(cached_start);
  std::printf("cached: %zu lookups, %zu failed, %.3f s, %.0f lookups/s\n", cached_count, cached_failed, cached,
              cached_count / cached);
  dns_shutdown();
  sockets_close_all();
  return failed || cached_failed ? 1 : 0;
}
