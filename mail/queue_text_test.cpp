#include "mail/queue_text.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>

namespace velmor {
namespace {

std::uint32_t ip(const char* text) {
  in_addr a{};
  inet_pton(AF_INET, text, &a);
  return a.s_addr;
}

TEST(EnvelopeAddress, FindsTheAddressInTheFormsClientsWrite) {
  EXPECT_EQ(envelope_address("FROM:<ann@example.org>"), "ann@example.org");
  EXPECT_EQ(envelope_address("FROM: <ann@example.org> SIZE=1000"), "ann@example.org");
  EXPECT_EQ(envelope_address("TO:bob@example.org NOTIFY=NEVER"), "bob@example.org");
  EXPECT_EQ(envelope_address("RCPT TO:<bob>\r\nMAIL"), "bob");
  EXPECT_EQ(envelope_address("POP3 MAIL FROM:<x@y>\r\n"), "x@y");
  EXPECT_EQ(envelope_address("FROM:<>"), "");
  EXPECT_EQ(envelope_address("FROM:<unclosed@example.org"), "unclosed@example.org");
  EXPECT_EQ(envelope_address("no colon at all"), "");
  EXPECT_EQ(envelope_address(""), "");
}

TEST(EnvelopeAddress, KeywordAndDomain) {
  EXPECT_TRUE(envelope_keyword("FROM:<a>", "from"));
  EXPECT_TRUE(envelope_keyword("from :<a>", "from"));
  EXPECT_FALSE(envelope_keyword("FROMX:<a>", "from"));
  EXPECT_FALSE(envelope_keyword("TO:<a>", "from"));
  EXPECT_FALSE(envelope_keyword("FROM", "from"));
  EXPECT_EQ(address_domain("a@b@example.org"), "example.org");
  EXPECT_EQ(address_domain("local"), "");
}

TEST(EnvelopePath, OnlyAddressesThatReadBackTheSameAreTaken) {
  EXPECT_EQ(parse_envelope_path("TO: <a@b.example>  ", "to", false).address, "a@b.example");
  EXPECT_EQ(parse_envelope_path("FROM:<>", "from", true).result, PathResult::ok);
  EXPECT_EQ(parse_envelope_path("TO:<>", "to", false).result, PathResult::syntax);
  EXPECT_EQ(parse_envelope_path("FROM <a@b>", "from", true).result, PathResult::syntax);
  EXPECT_EQ(parse_envelope_path("TO:a>b@c", "to", false).result, PathResult::bad_chars);
  EXPECT_EQ(parse_envelope_path("TO:<a b@c>", "to", false).result, PathResult::bad_chars);
  EXPECT_EQ(parse_envelope_path("TO:<a\x01@c>", "to", false).result, PathResult::bad_chars);
  EXPECT_EQ(parse_envelope_path("TO:<" + std::string(257, 'a') + ">", "to", false).result, PathResult::too_long);
}

TEST(Relay, StrangersMayNotRelayWhileTheSiteNetworkMay) {
  AddressList none;
  EXPECT_TRUE(relay_permitted(ip("127.0.0.1"), none));
  EXPECT_TRUE(relay_permitted(ip("10.1.2.3"), none));
  EXPECT_TRUE(relay_permitted(ip("172.16.0.1"), none));
  EXPECT_TRUE(relay_permitted(ip("172.31.255.255"), none));
  EXPECT_TRUE(relay_permitted(ip("192.168.7.7"), none));
  EXPECT_FALSE(relay_permitted(ip("172.32.0.1"), none));
  EXPECT_FALSE(relay_permitted(ip("192.169.0.1"), none));
  EXPECT_FALSE(relay_permitted(ip("8.8.8.8"), none));
  EXPECT_FALSE(relay_permitted(ip("11.0.0.1"), none));
  // Once smtp.allow names peers, only they may relay.
  AddressList allow = address_list_parse("203.0.113.5");
  ASSERT_FALSE(allow.empty());
  EXPECT_TRUE(relay_permitted(ip("203.0.113.5"), allow));
  EXPECT_FALSE(relay_permitted(ip("203.0.113.6"), allow));
  EXPECT_FALSE(relay_permitted(ip("192.168.1.1"), allow));
}

TEST(FilterPhrases, QuotedAndPlainPhrases) {
  EXPECT_EQ(filter_phrases("'a','b','c'"), (std::vector<std::string>{"a", "b", "c"}));
  EXPECT_EQ(filter_phrases("  buy now ,cheap pills"), (std::vector<std::string>{"buy now", "cheap pills"}));
  EXPECT_EQ(filter_phrases("'one, two', three"), (std::vector<std::string>{"one, two", "three"}));
  EXPECT_EQ(filter_phrases(std::string(80, 'x')).front().size(), 60u);
  EXPECT_TRUE(filter_phrases("").empty());
  EXPECT_TRUE(filter_phrases(" , ,").empty());
}

// Runs a DATA stream through the receiver in pieces of `step` bytes, the
// way reads arrive; returns the stored text and what was left unconsumed.
std::pair<std::string, std::string> receive(std::string_view stream, std::size_t step) {
  MessageReceiver r;
  r.now = 86400 * 365;
  std::string out, buffer;
  std::size_t pos = 0;
  while (!r.done() && pos < stream.size()) {
    buffer += stream.substr(pos, step);
    pos += step;
    buffer.erase(0, r.feed(buffer, false, out));
  }
  if (pos < stream.size()) buffer += stream.substr(pos);
  return {out, buffer};
}

TEST(MessageReceiver, StoresTheMessageAndAddsAMissingDate) {
  const std::string stream = "Subject: hi\r\nFrom: a@b\r\n\r\nbody\r\n..dotted\r\n.\r\nQUIT\r\n";
  auto [out, rest] = receive(stream, stream.size());
  EXPECT_EQ(out.substr(0, 25), "Subject: hi\r\nFrom: a@b\r\nD");
  EXPECT_NE(out.find("\r\nDate: "), std::string::npos);
  EXPECT_EQ(out.substr(out.find("\r\n\r\n")), "\r\n\r\nbody\r\n..dotted\r\n.\r\n");
  EXPECT_EQ(rest, "QUIT\r\n");
  // However the reads fall, even byte by byte, the stored text is the same.
  for (std::size_t step : {1u, 2u, 3u, 5u, 7u}) {
    auto [o, r] = receive(stream, step);
    EXPECT_EQ(o, out) << "step " << step;
    EXPECT_EQ(r, "QUIT\r\n") << "step " << step;
  }
}

TEST(MessageReceiver, KeepsAnExistingDateAndFindsASplitTerminator) {
  auto [out, rest] = receive("DATE: Mon, 1 Jan 2024 00:00:00 +0000\r\n\r\nx\r\n.\r\n", 1000);
  EXPECT_EQ(out, "DATE: Mon, 1 Jan 2024 00:00:00 +0000\r\n\r\nx\r\n.\r\n");
  MessageReceiver r;
  std::string stored;
  std::string buffer = "Date: x\r\n\r\nline\r\n.";
  buffer.erase(0, r.feed(buffer, false, stored));
  EXPECT_FALSE(r.done());
  buffer += "\r\n";
  r.feed(buffer, false, stored);
  EXPECT_TRUE(r.done());
  EXPECT_EQ(stored, "Date: x\r\n\r\nline\r\n.\r\n");
}

TEST(MessageReceiver, BareLineFeedsAndOddMessages) {
  // A careless client's bare LF ends lines, and ".\n" ends the message.
  auto [out, rest] = receive("Date: d\n\nline\n.\n", 1000);
  EXPECT_EQ(out, "Date: d\r\n\r\nline\r\n.\r\n");
  // An empty message, a header without body, and ".x" which is no end.
  EXPECT_EQ(receive(".\r\n", 100).first.substr(0, 6), "Date: ");
  auto [h, hr] = receive("Subject: s\r\n.\r\n", 100);
  EXPECT_EQ(h.substr(0, 18), "Subject: s\r\nDate: ");
  EXPECT_EQ(h.substr(h.size() - 5), "\r\n.\r\n");
  MessageReceiver r;
  std::string o;
  r.feed("Date: d\r\n\r\n.x\r\n", false, o);
  EXPECT_FALSE(r.done());
}

TEST(MessageReceiver, PassesOnALineLongerThanTheBuffer) {
  MessageReceiver r;
  std::string out;
  std::string part = "Date: d\r\n\r\n" + std::string(100, 'a') + "\r";
  std::size_t used = r.feed(part, false, out);
  EXPECT_EQ(used, 11u);  // the header; the long line waits
  part.erase(0, used);
  used = r.feed(part, true, out);
  EXPECT_EQ(used, 100u);  // the CR may be half of a line end: it waits
  part.erase(0, used);
  part += "\n.\r\n";  // the long line ends; then a "." line: the message ends
  r.feed(part, false, out);
  EXPECT_TRUE(r.done());
  EXPECT_EQ(out, "Date: d\r\n\r\n" + std::string(100, 'a') + "\r\n.\r\n");
  // A "." that merely continues a long line is not the terminator.
  MessageReceiver r2;
  std::string o2;
  r2.feed("Date: d\r\n\r\nabc", true, o2);
  r2.feed(".\r\n", false, o2);
  EXPECT_FALSE(r2.done());
}

}  // namespace
}  // namespace velmor
