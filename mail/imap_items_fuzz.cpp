// Any text as a FETCH item list: the parser never reads outside it, and
// what it accepts renders a response a client can read.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "core/globals.h"
#include "mail/imap_check.h"
#include "mail/imap_render.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"

namespace {

const char kMessage[] =
    "From: Ann <ann@example.org>\r\nSubject: pics\r\nContent-Type: multipart/mixed; boundary=o\r\n\r\n"
    "--o\r\nContent-Type: multipart/alternative; boundary=i\r\n\r\n--i\r\n\r\nplain\r\n"
    "--i\r\nContent-Type: text/html\r\n\r\n<p>x</p>\r\n..dot\r\n--i--\r\n"
    "--o\r\nContent-Type: message/rfc822\r\n\r\nSubject: inner\r\n\r\ntext\r\n--o--\r\n.\r\n";

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  server_now = 1700000000;
  FetchRequest req;
  if (imap_fetch_parse(std::string_view(reinterpret_cast<const char*>(data), size), req) != FetchParse::ok) return 0;
  if (req.items.empty()) std::abort();
  static const std::string text = mailbox_separator("MAIL FROM:<a@b>", server_now) + kMessage;
  TextSource in(text);
  Mailbox box;
  mailbox_parse_message(in, 0, box);
  FetchTarget target{box.messages.front(), 0, 1, 0};
  ImapBuffer buf;
  FetchResult r = imap_fetch_render(req, target, in, {.uid_mode = true, .may_set_seen = true}, buf);
  if (r.status != FetchStatus::done || r.seen_set != req.sets_seen()) std::abort();
  auto out = buf.flatten(in);
  std::uint32_t seq = 0;
  std::vector<std::pair<std::string, imap_check::Value>> items;
  if (!out || !imap_check::Reader(*out).fetch(seq, items).empty() || seq != 1) std::abort();
  return 0;
}
