#include "mail/imap_render.h"

#include <gtest/gtest.h>

#include <algorithm>

#include "mail/imap_address.h"
#include "mail/imap_check.h"
#include "mail/mailfile.h"

namespace velmor {
namespace {

using imap_check::Value;
using Items = std::vector<std::pair<std::string, Value>>;

// A message as a client should see it, and as delivery stores it: behind a
// separator line, dot-stuffed, ending with the "." line.
std::string stored(std::string_view plain) {
  std::string out = mailbox_separator("MAIL FROM:<ann@example.org>", 1700000000);
  bool at_start = true;
  for (char c : plain) {
    if (at_start && c == '.') out += '.';
    out += c;
    at_start = c == '\n';
  }
  return out + ".\r\n";
}

struct Box {
  explicit Box(std::string_view plain, std::string_view before = {}) {
    text = std::string(before) + stored(plain);
    TextSource in(text);
    for (std::uint64_t off = 0; off != kNoMessage;) off = mailbox_parse_message(in, off, box);
  }
  MessageRecord& last() { return box.messages.back(); }
  std::uint64_t offset() const { return box.bytes - box.messages.back().total_length; }

  // The response to FETCH `items` of the last message, checked as a client
  // reads it.
  std::string fetch(std::string_view items, FetchOptions options = {}, std::uint32_t flags = 0,
                    FetchResult* result = nullptr) {
    FetchRequest req;
    EXPECT_EQ(imap_fetch_parse(items, req), FetchParse::ok) << items;
    TextSource in(text);
    FetchTarget target{last(), offset(), 7, flags};
    ImapBuffer buf;
    FetchResult r = imap_fetch_render(req, target, in, options, buf);
    if (result) *result = r;
    EXPECT_EQ(r.status, FetchStatus::done);
    std::string out = buf.flatten(in).value_or("<unreadable>");
    std::uint32_t seq = 0;
    parsed.clear();
    EXPECT_EQ(imap_check::Reader(out).fetch(seq, parsed), "") << out;
    EXPECT_EQ(seq, 7u);
    return out;
  }
  // The value of one item of the last response, as text.
  std::string item(std::string_view items, std::string_view name, FetchOptions options = {}) {
    fetch(items, options);
    const Value* v = imap_check::find(parsed, name);
    EXPECT_TRUE(v) << name;
    return v ? v->text : "";
  }

  std::string text;
  Mailbox box;
  Items parsed;
};

// The structure items as written, between "BODYSTRUCTURE " and the UID.
std::string structure(Box& b, std::string_view item = "BODYSTRUCTURE") {
  std::string r = b.fetch(item);
  std::size_t from = r.find(item) + item.size() + 1;
  return r.substr(from, r.rfind(" UID ") - from);
}

const char kPlain[] =
    "From: Ann Example <ann@example.org>\r\n"
    "To: bob@example.net, \"Carl, Jr.\" <carl@example.com> (the boss)\r\n"
    "Subject: Lunch\r\n"
    "Date: Tue, 14 Nov 2023 22:13:20 +0000\r\n"
    "Message-ID: <1@example.org>\r\n"
    "\r\n"
    "Hello Bob,\r\n"
    "see you.\r\n";

TEST(ImapRender, PlainMessageAsSentWithEnvelopeAndStructure) {
  Box b(kPlain);
  std::string whole = b.item("BODY[]", "BODY[]");
  EXPECT_EQ(whole, kPlain);  // behind the separator, without the "." line
  EXPECT_EQ(b.item("RFC822.SIZE", "RFC822.SIZE"), std::to_string(whole.size()));
  EXPECT_EQ(b.item("BODY.PEEK[TEXT]", "BODY[TEXT]"), "Hello Bob,\r\nsee you.\r\n");
  EXPECT_EQ(b.item("RFC822.HEADER", "RFC822.HEADER") + b.item("RFC822.TEXT", "RFC822.TEXT"), whole);
  EXPECT_EQ(b.item("BODY[1]", "BODY[1]"), "Hello Bob,\r\nsee you.\r\n");  // a single part is part 1
  EXPECT_EQ(b.fetch("ENVELOPE"),
            "* 7 FETCH (ENVELOPE (\"Tue, 14 Nov 2023 22:13:20 +0000\" \"Lunch\" "
            "((\"Ann Example\" NIL \"ann\" \"example.org\")) ((\"Ann Example\" NIL \"ann\" \"example.org\")) "
            "((\"Ann Example\" NIL \"ann\" \"example.org\")) "
            "((NIL NIL \"bob\" \"example.net\")(\"Carl, Jr.\" NIL \"carl\" \"example.com\")) NIL NIL NIL "
            "\"<1@example.org>\"))\r\n");
  // No Content-Type: text/plain in US-ASCII.
  EXPECT_EQ(structure(b), "(\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 22 2 NIL NIL NIL)");
  EXPECT_EQ(structure(b, "BODY"), "(\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 22 2)");
  std::string date = b.item("INTERNALDATE", "INTERNALDATE");
  EXPECT_EQ(date.size(), 26u) << date;  // "dd-Mon-yyyy hh:mm:ss +zzzz"
  EXPECT_EQ(date.substr(2, 10), "-Nov-2023 ");
}

TEST(ImapRender, DotLinesAreUnstuffedAndCounted) {
  const std::string plain = "Subject: dots\r\n\r\n.hidden line\r\n.\r\nlast\r\n";
  Box b(plain);
  EXPECT_NE(b.text.find("..hidden line\r\n..\r\nlast\r\n.\r\n"), std::string::npos);
  EXPECT_EQ(b.item("BODY[]", "BODY[]"), plain);
  EXPECT_EQ(b.item("RFC822.SIZE", "RFC822.SIZE"), std::to_string(plain.size()));
  EXPECT_EQ(b.item("BODY[TEXT]", "BODY[TEXT]"), ".hidden line\r\n.\r\nlast\r\n");
  EXPECT_EQ(structure(b), "(\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 23 3 NIL NIL NIL)");
  // Every partial is the same slice of the plain text, wherever it falls.
  for (std::size_t start = 0; start <= plain.size() + 1; ++start) {
    for (std::size_t count = 1; count <= plain.size() + 1 - std::min(start, plain.size()); ++count) {
      std::string name = "BODY[]<" + std::to_string(start) + ">";
      std::string items = "BODY.PEEK[]<" + std::to_string(start) + "." + std::to_string(count) + ">";
      ASSERT_EQ(b.item(items, name), plain.substr(std::min(start, plain.size()), count)) << items;
    }
  }
  EXPECT_EQ(b.fetch("BODY.PEEK[]<1000.10>"), "* 7 FETCH (BODY[]<1000> {0}\r\n UID 1)\r\n");
  // The text goes out as ranges of the file, unstuffed where they must be.
  FetchRequest req;
  ASSERT_EQ(imap_fetch_parse("BODY.PEEK[TEXT]", req), FetchParse::ok);
  TextSource in(b.text);
  FetchTarget target{b.last(), 0, 1, 0};
  ImapBuffer first, second;
  imap_fetch_render(req, target, in, {}, first);
  first.replay(second);
  EXPECT_EQ(second.flatten(in), first.flatten(in));
  EXPECT_EQ(first.flatten(in), "* 1 FETCH (BODY[TEXT] {23}\r\n.hidden line\r\n.\r\nlast\r\n UID 1)\r\n");
}

TEST(ImapRender, OverviewKeepsTheTextCountsAndOldOnesAreCountedOnDemand) {
  const std::string plain = "Subject: dots\r\n\r\n.a\r\n";
  Box b(plain);
  std::string overview = mailbox_overview_text(b.box);
  EXPECT_NE(overview.find("#text 1,3,1\n"), std::string::npos) << overview;
  // An overview written before the counts were kept.
  std::string old = overview;
  old.erase(old.find("#text"), old.find('\n', old.find("#text")) + 1 - old.find("#text"));
  Mailbox again;
  ASSERT_EQ(mailbox_overview_parse(again, old), 0);
  EXPECT_EQ(again.messages.back().dots, kUncounted);
  std::string expected = b.fetch("(RFC822.SIZE BODY.PEEK[])");
  b.box.messages = again.messages;
  EXPECT_EQ(b.fetch("(RFC822.SIZE BODY.PEEK[])"), expected);
  EXPECT_EQ(b.last().dots, 1u);
  EXPECT_EQ(b.last().end_line, 3u);
  EXPECT_EQ(b.last().body_lines, 1u);
  // Counts that do not fit the message make the overview unreadable (it is rebuilt).
  std::string bad = overview;
  bad.replace(bad.find("#text 1,3,1"), 11, "#text 1,5,1");
  EXPECT_NE(mailbox_overview_parse(again, bad), 0);
}

const char kNested[] =
    "From: ann@example.org\r\n"
    "Subject: pics\r\n"
    "Content-Type: multipart/mixed;\r\n"
    "  boundary=\"outer\"\r\n"
    "\r\n"
    "preamble\r\n"
    "--outer\r\n"
    "Content-Type: multipart/alternative; boundary=inner\r\n"
    "\r\n"
    "--inner\r\n"
    "Content-Type: text/plain; charset=utf-8\r\n"
    "\r\n"
    "plain text\r\n"
    "--inner\r\n"
    "Content-Type: text/html; charset=utf-8\r\n"
    "Content-Transfer-Encoding: quoted-printable\r\n"
    "\r\n"
    "<p>html</p>\r\n"
    ".dot\r\n"
    "--inner--\r\n"
    "\r\n"
    "--outer\r\n"
    "Content-Type: application/pdf; name=\"a b.pdf\"\r\n"
    "Content-Transfer-Encoding: base64\r\n"
    "Content-ID: <pdf1>\r\n"
    "Content-Description: the file\r\n"
    "\r\n"
    "SGVsbG8=\r\n"
    "--outer--\r\n"
    "epilogue\r\n";

TEST(ImapRender, NestedMultipartStructureAndParts) {
  Box b(kNested);
  EXPECT_EQ(structure(b),
            "(((\"TEXT\" \"PLAIN\" (\"CHARSET\" \"utf-8\") NIL NIL \"7BIT\" 10 1 NIL NIL NIL)"
            "(\"TEXT\" \"HTML\" (\"CHARSET\" \"utf-8\") NIL NIL \"QUOTED-PRINTABLE\" 17 2 NIL NIL NIL)"
            " \"ALTERNATIVE\" (\"BOUNDARY\" \"inner\") NIL NIL)"
            "(\"APPLICATION\" \"PDF\" (\"NAME\" \"a b.pdf\") \"<pdf1>\" \"the file\" \"BASE64\" 8 NIL NIL NIL)"
            " \"MIXED\" (\"BOUNDARY\" \"outer\") NIL NIL)");
  EXPECT_EQ(b.item("BODY.PEEK[1.1]", "BODY[1.1]"), "plain text");
  EXPECT_EQ(b.item("BODY.PEEK[1.2]", "BODY[1.2]"), "<p>html</p>\r\n.dot");
  EXPECT_EQ(b.item("BODY.PEEK[2]", "BODY[2]"), "SGVsbG8=");
  EXPECT_EQ(b.item("BODY.PEEK[1.2]<3.9>", "BODY[1.2]<3>"), "html</p>\r");
  EXPECT_EQ(b.item("BODY.PEEK[1.2.MIME]", "BODY[1.2.MIME]"),
            "Content-Type: text/html; charset=utf-8\r\nContent-Transfer-Encoding: quoted-printable\r\n\r\n");
  EXPECT_EQ(b.item("BODY.PEEK[1]", "BODY[1]"),
            "--inner\r\nContent-Type: text/plain; charset=utf-8\r\n\r\nplain text\r\n--inner\r\n"
            "Content-Type: text/html; charset=utf-8\r\nContent-Transfer-Encoding: quoted-printable\r\n\r\n"
            "<p>html</p>\r\n.dot\r\n--inner--\r\n");
  EXPECT_EQ(b.fetch("BODY.PEEK[3]"), "* 7 FETCH (BODY[3] {0}\r\n UID 1)\r\n");
  EXPECT_EQ(b.fetch("BODY.PEEK[1.2.3]"), "* 7 FETCH (BODY[1.2.3] {0}\r\n UID 1)\r\n");
  // The size of the whole is still what BODY[] sends.
  EXPECT_EQ(b.item("RFC822.SIZE", "RFC822.SIZE"), std::to_string(b.item("BODY.PEEK[]", "BODY[]").size()));
}

TEST(ImapRender, AContentTypeEndingInAQuotingBackslashStillRenders) {
  // A comment cut short by a lone backslash once read past the value's end.
  Box b("Content-Type: text/plain; (a\\\r\n\r\nbody\r\n");
  EXPECT_EQ(structure(b, "BODY"), "(\"TEXT\" \"PLAIN\" NIL NIL NIL \"7BIT\" 6 1)");
}

TEST(ImapRender, AttachedMessageHasItsEnvelopeAndItsOwnSections) {
  const char text[] =
      "Subject: fwd\r\nContent-Type: multipart/mixed; boundary=b\r\n\r\n"
      "--b\r\n\r\nsee below\r\n"
      "--b\r\nContent-Type: message/rfc822\r\n\r\n"
      "From: carl@example.com\r\nSubject: inner\r\n\r\nline 1\r\nline 2\r\n"
      "--b--\r\n";
  Box b(text);
  EXPECT_EQ(structure(b, "BODY"),
            "((\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 9 1)"
            "(\"MESSAGE\" \"RFC822\" NIL NIL NIL \"7BIT\" 56 "
            "(NIL \"inner\" ((NIL NIL \"carl\" \"example.com\")) ((NIL NIL \"carl\" \"example.com\")) "
            "((NIL NIL \"carl\" \"example.com\")) NIL NIL NIL NIL NIL) "
            "(\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 14 2) 5) \"MIXED\")");
  EXPECT_EQ(b.item("BODY.PEEK[2.HEADER]", "BODY[2.HEADER]"), "From: carl@example.com\r\nSubject: inner\r\n\r\n");
  EXPECT_EQ(b.item("BODY.PEEK[2.TEXT]", "BODY[2.TEXT]"), "line 1\r\nline 2");
  EXPECT_EQ(b.item("BODY.PEEK[2.HEADER.FIELDS (SUBJECT)]", "BODY[2.HEADER.FIELDS (SUBJECT)]"),
            "Subject: inner\r\n\r\n");
  EXPECT_EQ(b.fetch("BODY.PEEK[1.HEADER]"), "* 7 FETCH (BODY[1.HEADER] {0}\r\n UID 1)\r\n");
}

TEST(ImapRender, HeaderFieldsWithContinuationsAndTheBlankLine) {
  Box b(
      "From: ann@example.org\r\nTo: bob@example.net,\r\n carl@example.com\r\nSubject: hi\r\n"
      "Received: x\r\n\r\nbody\r\n");
  EXPECT_EQ(b.item("BODY.PEEK[HEADER.FIELDS (to \"Subject\")]", "BODY[HEADER.FIELDS (to Subject)]"),
            "To: bob@example.net,\r\n carl@example.com\r\nSubject: hi\r\n\r\n");
  EXPECT_EQ(b.item("BODY.PEEK[HEADER.FIELDS.NOT (To Received)]", "BODY[HEADER.FIELDS.NOT (To Received)]"),
            "From: ann@example.org\r\nSubject: hi\r\n\r\n");
  EXPECT_EQ(b.item("BODY.PEEK[HEADER.FIELDS (X-None)]", "BODY[HEADER.FIELDS (X-None)]"), "\r\n");
  EXPECT_EQ(b.item("BODY.PEEK[HEADER.FIELDS (From)]<2.4>", "BODY[HEADER.FIELDS (From)]<2>"), "om: ");
}

TEST(ImapRender, StringsAreQuotedOrLiteral) {
  Box b(
      "Subject: say \"hi\" \\ bye\r\nFrom: \"Ren\xc3\xa9\" <rene@example.org>\r\n"
      "In-Reply-To: <0@x>\r\n\r\nx\r\n");
  std::string r = b.fetch("ENVELOPE");
  EXPECT_NE(r.find("NIL \"say \\\"hi\\\" \\\\ bye\" (({5}\r\nRen\xc3\xa9 NIL \"rene\" \"example.org\"))"),
            std::string::npos)
      << r;
  EXPECT_NE(r.find(" \"<0@x>\" NIL))\r\n"), std::string::npos) << r;
  std::string s;
  imap_append_string(s, std::string_view("a\0b", 3));
  imap_append_nstring(s, std::nullopt);
  imap_append_string(s, "");
  EXPECT_EQ(s, std::string("{3}\r\na\0bNIL\"\"", 13));
}

TEST(ImapRender, SeenIsSetOnlyWhereAllowedAndShown) {
  Box b(kPlain);
  FetchResult r;
  EXPECT_EQ(b.fetch("BODY[HEADER.FIELDS (Subject)]", {}, msgflag::answered, &r),
            "* 7 FETCH (BODY[HEADER.FIELDS (Subject)] {18}\r\nSubject: Lunch\r\n\r\n UID 1 FLAGS (\\Seen "
            "\\Answered))\r\n");
  EXPECT_TRUE(r.seen_set);
  b.fetch("(FLAGS RFC822.TEXT)", {}, 0, &r);
  EXPECT_TRUE(r.seen_set);
  ASSERT_EQ(b.parsed.size(), 3u);  // FLAGS, RFC822.TEXT, UID: the flags once, with \Seen
  EXPECT_EQ(b.parsed[0].first, "FLAGS");
  ASSERT_EQ(b.parsed[0].second.list.size(), 1u);
  EXPECT_EQ(b.parsed[0].second.list[0].text, "\\Seen");
  for (const char* peek : {"BODY.PEEK[]", "RFC822.HEADER", "RFC822.SIZE", "BODYSTRUCTURE"}) {
    b.fetch(peek, {}, 0, &r);
    EXPECT_FALSE(r.seen_set) << peek;
  }
  // EXAMINE: nothing is set, nor shown.
  EXPECT_EQ(b.fetch("RFC822.SIZE", {.uid_mode = true, .may_set_seen = false}, 0, &r),
            "* 7 FETCH (RFC822.SIZE 209 UID 1)\r\n");
  b.fetch("BODY[]", {.uid_mode = false, .may_set_seen = false}, 0, &r);
  EXPECT_FALSE(r.seen_set);
  b.fetch("BODY[]", {}, msgflag::seen, &r);
  EXPECT_FALSE(r.seen_set);  // seen already
}

TEST(ImapRender, FlagsAllFiveAndRecent) {
  EXPECT_EQ(imap_flag_list(0), "()");
  EXPECT_EQ(imap_flag_list(msgflag::seen | msgflag::answered | msgflag::flagged | msgflag::deleted |
                           msgflag::draft | msgflag::recent | msgflag::mime | msgflag::receipt_wanted),
            "(\\Seen \\Answered \\Flagged \\Deleted \\Draft \\Recent)");
  EXPECT_EQ(imap_flag_bit("\\FLAGGED"), msgflag::flagged);
  EXPECT_EQ(imap_flag_bit("\\Draft"), msgflag::draft);
  EXPECT_EQ(imap_flag_bit("\\Recent"), 0u);
  EXPECT_EQ(imap_flag_bit("$Junk"), 0u);
}

TEST(ImapRender, UnreadableMessageSendsNothing) {
  Box b(kPlain);
  b.text.resize(b.text.size() - 10);  // the file was cut under the record
  FetchRequest req;
  ASSERT_EQ(imap_fetch_parse("FLAGS", req), FetchParse::ok);
  TextSource in(b.text);
  FetchTarget target{b.last(), 0, 1, 0};
  ImapBuffer out;
  EXPECT_EQ(imap_fetch_render(req, target, in, {}, out).status, FetchStatus::unreadable);
  EXPECT_TRUE(out.empty());
}

TEST(ImapItems, ParsesTheGrammarAndRefusesTheRest) {
  FetchRequest r;
  ASSERT_EQ(imap_fetch_parse("ALL", r), FetchParse::ok);
  EXPECT_EQ(r.items.size(), 4u);
  ASSERT_EQ(imap_fetch_parse("(uid body.peek[1.2.HEADER.FIELDS.NOT (A \"b(c\")]<5.10> rfc822)", r), FetchParse::ok);
  ASSERT_EQ(r.items.size(), 3u);
  const FetchItem& s = r.items[1];
  EXPECT_EQ(s.section.part, (std::vector<std::uint32_t>{1, 2}));
  EXPECT_EQ(s.section.kind, FetchSection::Kind::fields_not);
  EXPECT_EQ(s.section.fields, (std::vector<std::string>{"A", "b(c"}));
  EXPECT_TRUE(s.peek && s.partial && s.start == 5 && s.count == 10);
  EXPECT_TRUE(r.sets_seen());  // RFC822
  for (const char* bad : {"", "()", "(FLAGS", "FLAGS)", "FLAGS UID", "(FLAGS  UID)", "BODY[", "BODY[0]",
                          "BODY[1.]", "BODY[MIME]", "BODY[TEXT.1]", "BODY[HEADER.FIELDS]",
                          "BODY[HEADER.FIELDS ()]", "BODY[]<1>", "BODY[]<1.>", "BODY.PEEK", "BODY[]<99999999999.1>",
                          "FOO", "(FLAGS) x", "BODY[HEADER.FIELDS (\"a)]",
                          "BODY[HEADER.FIELDS (\"a b\")]", "BODY[HEADER.FIELDS (a:b)]", "BODY[HEADER.FIELDS (\"\")]",
                          "BODY[HEADER.FIELDS (Caf\xc3\xa9)]"}) {
    EXPECT_EQ(imap_fetch_parse(bad, r), FetchParse::bad) << bad;
  }
}

TEST(ImapAddress, TokensAndLists) {
  std::string w;
  std::size_t at = 0;
  std::string_view v = "\"Doe, J\" <j@x.org> (home),\r\n bob@y\r\nTo: not this";
  EXPECT_EQ(address_token_next(v, at, w), AddressToken::quoted);
  EXPECT_EQ(w, "Doe, J");
  EXPECT_EQ(address_token_next(v, at, w), AddressToken::angle);
  EXPECT_EQ(w, "j@x.org");
  EXPECT_EQ(address_token_next(v, at, w), AddressToken::comma);
  EXPECT_EQ(address_token_next(v, at, w), AddressToken::atom);
  EXPECT_EQ(w, "bob@y");
  EXPECT_EQ(address_token_next(v, at, w), AddressToken::end);

  auto list = mail_address_list("Ann <a@x>, group: ;, b@y (Bob), \"c@z\" <c@z.org>, tom&jerry@w");
  ASSERT_EQ(list.size(), 4u);
  EXPECT_EQ(list[0].name, "Ann");
  EXPECT_EQ(list[1].mailbox + "@" + list[1].host, "b@y");
  EXPECT_EQ(list[2].name, "c@z");
  EXPECT_EQ(list[2].host, "z.org");
  EXPECT_EQ(list[3].mailbox, "tom&jerry");
  std::string longer(400, 'a');
  at = 0;
  address_token_next(longer, at, w);
  EXPECT_EQ(w.size(), 253u);
  EXPECT_EQ(at, longer.size());
}

TEST(ImapRender, StructuresAreBoundedInPartsAndDepth) {
  // Past the part count the body is one opaque part, shown and fetched so.
  std::string flat_body;
  for (int i = 0; i < 1500; ++i) flat_body += "--b\r\n\r\npart\r\n";
  flat_body += "--b--\r\n";
  Box flat("Content-Type: multipart/mixed; boundary=b\r\n\r\n" + flat_body);
  EXPECT_EQ(structure(flat, "BODY"),
            "(\"APPLICATION\" \"OCTET-STREAM\" NIL NIL NIL \"7BIT\" " + std::to_string(flat_body.size()) + ")");
  EXPECT_EQ(flat.item("BODY.PEEK[1]", "BODY[1]"), flat_body);
  EXPECT_EQ(flat.fetch("BODY.PEEK[2]"), "* 7 FETCH (BODY[2] {0}\r\n UID 1)\r\n");
  // Within the count, the multipart that would pass it is the one shown
  // as one part: the parts before and after it keep their structure.
  std::string big;
  for (int i = 0; i < 998; ++i) big += "--in\r\n\r\nx\r\n";
  Box nested("Content-Type: multipart/mixed; boundary=out\r\n\r\n--out\r\n\r\nfirst\r\n"
             "--out\r\nContent-Type: multipart/mixed; boundary=in\r\n\r\n" + big + "--in--\r\n"
             "--out\r\n\r\nlast\r\n--out--\r\n");
  EXPECT_EQ(structure(nested, "BODY"),
            "((\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 5 1)"
            "(\"APPLICATION\" \"OCTET-STREAM\" NIL NIL NIL \"7BIT\" " + std::to_string(big.size() + 6) + ")"
            "(\"TEXT\" \"PLAIN\" (\"CHARSET\" \"US-ASCII\") NIL NIL \"7BIT\" 4 1) \"MIXED\")");
  EXPECT_EQ(nested.item("BODY.PEEK[3]", "BODY[3]"), "last");
  EXPECT_EQ(nested.fetch("BODY.PEEK[2.1]"), "* 7 FETCH (BODY[2.1] {0}\r\n UID 1)\r\n");
  // Nested too deep: the deepest multipart shown is one part.
  std::string deep = "Content-Type: multipart/mixed; boundary=b0\r\n\r\n";
  for (int i = 1; i <= 40; ++i)
    deep += "--b" + std::to_string(i - 1) + "\r\nContent-Type: multipart/mixed; boundary=b" + std::to_string(i) +
            "\r\n\r\n";
  deep += "--b40\r\n\r\nleaf\r\n";
  Box d(deep);
  std::string s = structure(d, "BODY");
  EXPECT_EQ(s.find("\"TEXT\""), std::string::npos) << s;
  EXPECT_EQ(s.find("(\"APPLICATION\" \"OCTET-STREAM\""), s.rfind('(')) << s;
  EXPECT_EQ(std::count(s.begin(), s.end(), '('), 33) << s;
}

TEST(ImapSearch, TextIsDecodedFoldedAndBounded) {
  Box b("Subject: =?UTF-8?B?0J/RgNC40LLQtdGC?= World\r\n"
        "Cc: Carl <CARL@example.com>,\r\n dora@example.com\r\n"
        "Content-Type: multipart/mixed; boundary=b\r\n\r\n"
        "--b\r\nContent-Type: text/plain; charset=koi8-r\r\nContent-Transfer-Encoding: base64\r\n\r\n8NLJ18XU\r\n"
        "--b\r\nContent-Type: text/plain; charset=utf-8\r\nContent-Transfer-Encoding: quoted-printable\r\n\r\n"
        ".Dotted CAF=C3=89 soft=\r\nbreak\r\n"
        "--b\r\nContent-Type: application/octet-stream\r\n\r\nattached words\r\n"
        "--b--\r\n");
  TextSource in(b.text);
  MessageRecord& m = b.last();
  SearchText t;
  ASSERT_TRUE(imap_search_text(in, m, b.offset(), false, t));
  EXPECT_EQ(t.fields, (std::vector<std::pair<std::string, std::string>>{
                          {"Subject", "привет world"},
                          {"Cc", "carl <carl@example.com>, dora@example.com"},
                          {"Content-Type", "multipart/mixed; boundary=b"}}));
  EXPECT_FALSE(t.body_read);
  ASSERT_TRUE(imap_search_text(in, m, b.offset(), true, t));
  EXPECT_EQ(t.body, "привет\n.dotted café softbreak\n");  // not the attachment
  // A long body is cut at the bound.
  Box big("Subject: big\r\n\r\n" + std::string(kSearchBodyKeep + 1000, 'A') + "\r\n");
  TextSource big_in(big.text);
  SearchText u;
  ASSERT_TRUE(imap_search_text(big_in, big.last(), big.offset(), true, u));
  EXPECT_EQ(u.body, std::string(kSearchBodyKeep, 'a') + "\n");
  EXPECT_EQ(imap_message_size(in, m, b.offset()), b.item("BODY.PEEK[]", "BODY[]").size());
}

}  // namespace
}  // namespace velmor
