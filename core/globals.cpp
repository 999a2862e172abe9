// The process-wide words, and the name this host goes by.
#include "core/globals.h"

#include <unistd.h>

#include <cstdlib>
#include <vector>

namespace velmor {

std::time_t server_now = 0;
std::atomic<std::uint32_t> progress_code{0};
volatile std::sig_atomic_t quit_flag = 0;
int mail_transfer_state = 0;
int link_up = 0;
int link_probe_due = 0;
std::uint32_t log_mask = 0;
std::uint32_t status_bits = 0;
SuitePaths paths;

const std::string& host_name() {
  static const std::string name = [] {
    const char* host = std::getenv("inet$hostname");
    if (host && *host) {
      std::string n = host;
      const char* domain = std::getenv("inet$localdomain");
      if (domain && *domain) n += std::string(".") + domain;
      return n;
    }
    std::vector<char> buf(256);
    while (gethostname(buf.data(), buf.size()) != 0 && buf.size() < 65536) buf.resize(buf.size() * 2);
    buf.back() = 0;
    std::string n(buf.data());
    return n.empty() ? std::string("localhost") : n;
  }();
  return name;
}

}  // namespace velmor
