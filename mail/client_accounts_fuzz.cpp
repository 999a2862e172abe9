// The mail clients' account lines (pop.hosts, smtp.hosts) from arbitrary
// text: every account read has its fields, what is written back reads back
// the same, and a relay rebuilt from its fields parses to those fields.
#include <cstdint>
#include <string>

#include "mail/pop_client.h"
#include "mail/session_fuzz.h"
#include "mail/smtp_client.h"

using namespace velmor;
using velmor::fuzzing::check;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string text(reinterpret_cast<const char*>(data), size);
  const std::vector<PopAccount> accounts = pop_accounts_parse(text);
  for (const PopAccount& a : accounts) check(!a.user.empty() && !a.host.empty() && a.port != 0);
  const std::string shown = pop_accounts_show(accounts);
  check(pop_accounts_show(pop_accounts_parse(shown)) == shown);

  SmtpRelay relay;
  if (smtp_relay_parse(text, relay) == RelayParse::ok) {
    check(!relay.host.empty() && relay.port != 0);
    check(relay.host.find_first_of(" \t,\r\n@:") == std::string::npos);
    std::string line = relay.host + ":" + std::to_string(relay.port);
    if (relay.login()) line = relay.user + ":" + relay.password + "@" + line;
    SmtpRelay again;
    check(smtp_relay_parse(line, again) == RelayParse::ok);
    check(again.user == relay.user && again.password == relay.password && again.host == relay.host &&
          again.port == relay.port);
  }
  return 0;
}
