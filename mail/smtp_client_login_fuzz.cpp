// The SMTP client logging in to a relay whose replies are arbitrary bytes,
// in pieces of any size, with TLS failing or not: whatever the server says,
// nothing goes out in the clear that carries the login (no AUTH command,
// neither the password nor the user in base64), nothing carries it when TLS
// never started, and every command is a whole CR LF line.
#include <cstdint>
#include <string>

#include "core/config.h"
#include "core/test_link.h"
#include "core/util.h"
#include "mail/session_fuzz.h"
#include "mail/smtp_client.h"

using namespace velmor;
using velmor::fuzzing::check;
using velmor::fuzzing::check_lines;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size < 1) return 0;
  config.server_name = "fuzz.example";
  const std::size_t piece = data[0] % 31 + 1;
  std::string_view input(reinterpret_cast<const char*>(data) + 1, size - 1);
  const SmtpRelay relay{"fuzz-user", "Pass-Word-1", "relay.example", 25};
  TestLink link(smtp_client_session(relay));
  if (data[0] & 0x80) link.refuse_tls();
  link.feed(input, piece);
  const std::string& all = link.output();
  check_lines(all);
  const std::string secrets[] = {"AUTH", "Pass-Word-1", base64_encode("Pass-Word-1"), base64_encode("fuzz-user"),
                                 base64_encode(std::string("\0fuzz-user\0Pass-Word-1", 22))};
  const std::string_view clear = link.clear_output();  // all of it when TLS never started
  for (const std::string& s : secrets) check(clear.find(s) == std::string_view::npos);
  if (link.tls_plan()) check(link.tls_plan()->verify == TlsVerify::peer && link.tls_plan()->host == "relay.example");
  return 0;
}
