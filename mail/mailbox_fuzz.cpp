// Any bytes as a mailbox file: the parser never throws, never reads outside
// its input, covers the file exactly, and its records fit their messages
// and come back unchanged through the overview.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "core/globals.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  server_now = 1700000000;  // unset dates are written as "now": the same in both texts
  std::string_view text(reinterpret_cast<const char*>(data), size);
  TextSource in(text);
  Mailbox box;
  for (std::uint64_t off = 0; off != kNoMessage;) off = mailbox_parse_message(in, off, box);
  if (mailbox_size(box) != size) std::abort();
  for (const MessageRecord& m : box.messages) {
    if (m.length > m.total_length || m.header_length > m.total_length) std::abort();
    for (const MimePart& p : m.parts) {
      if (p.body_offset > m.total_length || p.length > m.total_length - p.body_offset) std::abort();
    }
  }
  std::string overview = mailbox_overview_text(box);
  Mailbox back;
  if (mailbox_overview_parse(back, overview) != 0 || mailbox_overview_text(back) != overview) std::abort();
  return 0;
}
