// Any bytes as what an SMTP server says, read through the connection's line
// reader in pieces of any size: the replies read are the same however the
// reads split the input, each complete one has a real code and bounded
// text. The same bytes as a stored message: the "." lines found are exactly
// the lines that hold only "." (LF or CR LF ended).
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <string_view>

#include "core/network.h"
#include "core/test_link.h"
#include "mail/mailfile.h"
#include "mail/smtp_client.h"
#include "mail/smtp_reply.h"

namespace {

using namespace velmor;

void check(bool ok) {
  if (!ok) std::abort();
}

struct Reader final : Session {
  explicit Reader(std::string& log) : log_(log) {}
  void on_input(Connection& c) override {
    std::string_view line;
    for (LineResult r; !c.closed() && (r = c.read_line(line)) != LineResult::need_more;) {
      ReplyRead got = r == LineResult::overlong ? ReplyRead::malformed : reply_.add(line);
      if (got == ReplyRead::need_more) continue;
      if (got == ReplyRead::complete) {
        check(reply_.code() >= 200 && reply_.code() <= 599);
        check(reply_.text().size() <= SmtpReply::kMaxText);
        log_ += std::to_string(reply_.code()) + "|" + reply_.text() + "\n";
      } else {
        log_ += "malformed\n";
        c.close_now();
      }
      reply_.clear();
    }
  }
  std::string& log_;
  SmtpReply reply_;
};

std::string replies(std::string_view input, std::size_t piece) {
  std::string log;
  TestLink link(std::make_unique<Reader>(log), 4096);
  link.connection().set_line_limit(2048);
  link.feed(input, piece);
  return log;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const std::size_t piece = data[0] % 16 + 1;
  std::string_view input(reinterpret_cast<const char*>(data) + 1, size - 1);
  check(replies(input, 0) == replies(input, piece));

  TextSource text(input);
  bool whole = false;
  auto dots = lone_dot_lines(text, 0, input.size(), whole);
  check(whole);
  std::size_t expected = 0;
  for (std::size_t i = 0; i < input.size(); ++i) {
    if (input[i] != '.' || (i > 0 && input[i - 1] != '\n')) continue;
    std::string_view rest = input.substr(i + 1);
    if (rest.starts_with("\n") || rest.starts_with("\r\n")) {
      check(expected < dots.size() && dots[expected] == i);
      ++expected;
    }
  }
  check(expected == dots.size());
  return 0;
}
