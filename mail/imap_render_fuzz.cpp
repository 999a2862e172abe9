// Any bytes as a stored message: every FETCH item renders a response a
// client can read, each literal counts the bytes sent, BODY[] is the stored
// text unstuffed, partials are slices of their sections, and nothing is
// read outside the message (nor for SEARCH).
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

using namespace velmor;

// A source that aborts on a read that starts outside one message.
class Checked final : public ByteSource {
 public:
  Checked(ByteSource& in, std::uint64_t lo, std::uint64_t hi) : in_(in), lo_(lo), hi_(hi) {}
  std::uint64_t size() const override { return in_.size(); }
  std::string_view view(std::uint64_t offset, std::size_t want) override {
    if (offset < lo_ || offset > hi_) std::abort();
    return in_.view(offset, want);
  }

 private:
  ByteSource& in_;
  std::uint64_t lo_, hi_;
};

// The one section value of a response to `items`.
std::string fetch(MessageRecord& m, std::uint64_t offset, ByteSource& in, std::string_view items,
                  std::string_view name) {
  FetchRequest req;
  if (imap_fetch_parse(items, req) != FetchParse::ok) std::abort();
  FetchTarget target{m, offset, 3, m.flags};
  ImapBuffer buf;
  if (imap_fetch_render(req, target, in, {}, buf).status != FetchStatus::done) std::abort();
  auto out = buf.flatten(in);
  if (!out) std::abort();
  std::uint32_t seq = 0;
  std::vector<std::pair<std::string, imap_check::Value>> parsed;
  if (!imap_check::Reader(*out).fetch(seq, parsed).empty() || seq != 3) std::abort();
  if (name.empty()) return {};
  const imap_check::Value* v = imap_check::find(parsed, name);
  if (!v) std::abort();
  return v->text;
}

std::string slice(const std::string& s, std::uint32_t a, std::uint32_t n) {
  return a >= s.size() ? std::string() : s.substr(a, n);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  server_now = 1700000000;
  if (size < 2) return 0;
  std::uint32_t a = data[0] % 64, n = data[1] % 64 + 1;
  std::string text = mailbox_separator("MAIL FROM:<a@b>", server_now) +
                     std::string(reinterpret_cast<const char*>(data) + 2, size - 2);
  TextSource whole(text);
  Mailbox box;
  for (std::uint64_t off = 0; off != kNoMessage;) off = mailbox_parse_message(whole, off, box);
  std::uint64_t offset = 0;
  std::string pa = std::to_string(a) + "." + std::to_string(n);
  for (MessageRecord& m : box.messages) {
    Checked in(whole, offset, offset + m.total_length);
    fetch(m, offset, in,
          "(FLAGS INTERNALDATE RFC822.SIZE ENVELOPE BODY BODYSTRUCTURE UID BODY.PEEK[1.MIME] BODY.PEEK[2.1.MIME] "
          "BODY.PEEK[2.HEADER] BODY.PEEK[2.TEXT] BODY.PEEK[1.1.1] BODY.PEEK[HEADER.FIELDS.NOT (To)])",
          "");
    // BODY[] is the stored text behind the separator, unstuffed, without the "." line.
    std::string body = fetch(m, offset, in, "BODY.PEEK[]", "BODY[]");
    std::string expected;
    std::uint64_t start = offset + (m.total_length - m.length);
    if (!imap_unstuff_append(whole, start, m.length - m.end_line, expected) || body != expected) std::abort();
    if (fetch(m, offset, in, "RFC822.SIZE", "RFC822.SIZE") != std::to_string(body.size())) std::abort();
    if (fetch(m, offset, in, "BODY.PEEK[HEADER]", "BODY[HEADER]") + fetch(m, offset, in, "BODY.PEEK[TEXT]", "BODY[TEXT]") !=
        body)
      std::abort();
    // Partials are slices of their sections.
    for (std::string_view section : {"", "TEXT", "1", "1.2", "2.TEXT", "HEADER.FIELDS (From Subject)"}) {
      std::string s(section);
      std::string full = fetch(m, offset, in, "BODY.PEEK[" + s + "]", "BODY[" + s + "]");
      std::string part =
          fetch(m, offset, in, "BODY.PEEK[" + s + "]<" + pa + ">", "BODY[" + s + "]<" + std::to_string(a) + ">");
      if (part != slice(full, a, n)) std::abort();
    }
    // What SEARCH reads stays inside the message too, and within its bound.
    SearchText t;
    if (!imap_search_text(in, m, offset, true, t) || t.body.size() > kSearchBodyKeep + 1) std::abort();
    // A record that has not counted its text yet renders the same.
    MessageRecord old = m;
    old.dots = kUncounted;
    old.end_line = 0;
    old.body_lines = 0;
    if (fetch(old, offset, in, "BODY.PEEK[]", "BODY[]") != body || old.dots != m.dots || old.end_line != m.end_line ||
        old.body_lines != m.body_lines)
      std::abort();
    offset += m.total_length;
  }
  return 0;
}
