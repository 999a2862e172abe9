// Any text as a user's subscriptions file: every name read is one a client
// could have subscribed to, and what is written back reads back the same.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "mail/imap_server.h"
#include "mail/imap_subscriptions.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  auto names = imap_subscriptions_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  for (const auto& n : names) {
    if (n != "INBOX" && !imap_name_allowed(n)) std::abort();
  }
  if (imap_subscriptions_parse(imap_subscriptions_text(names)) != names) std::abort();
  return 0;
}
