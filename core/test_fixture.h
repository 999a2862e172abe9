// The one fixture every unit test that touches process-wide state derives
// from: each test starts from the built-in configuration, default paths, a
// clear loop (no services, connections, hooks or resolver), empty hooks, the
// file seam reset, and the process words at their start values; and leaves
// nothing open behind it.
#pragma once

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <cstdint>
#include <ctime>

#include "core/config.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/network.h"
#include "core/tls.h"

namespace velmor {

inline void reset_process_state() {
  net_reset();
  tls_reset();
  config_reset();
  paths = SuitePaths{};
  hooks = SuiteHooks{};
  sysio::reset();
  server_now = std::time(nullptr);
  mail_transfer_state = 0;
  link_up = 0;
  link_probe_due = 0;
  log_mask = 0;
  status_bits = 0;
  quit_flag = 0;
}

class SuiteTest : public ::testing::Test {
 protected:
  void SetUp() override { reset_process_state(); }
  void TearDown() override { reset_process_state(); }
};

// A TCP socket of the test's own on 127.0.0.1 and an ephemeral port: a
// listening peer for outward connections, or (not listening, closed at
// once) a port that nobody listens on.
struct LoopbackPeer {
  UniqueFd fd;
  std::uint16_t port = 0;
  explicit LoopbackPeer(bool listening = true) : fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_in a{};
    a.sin_family = AF_INET;
    a.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof a;
    if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&a), sizeof a) != 0 ||
        (listening && ::listen(fd.get(), 16) != 0) ||
        getsockname(fd.get(), reinterpret_cast<sockaddr*>(&a), &len) != 0)
      ADD_FAILURE() << "no loopback socket";
    port = ntohs(a.sin_port);
    if (!listening) fd.close();
  }
};

}  // namespace velmor
