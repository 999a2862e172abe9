// The SMTP session through the test driver (no sockets): the real service
// with its accept rule, line rules and group commit; the file layer's seam
// counts and fails the syncs, renames and writes of the commit.
#include "mail/smtp_server.h"

#include <arpa/inet.h>

#include <algorithm>

#include <limits>
#include <set>

#include "core/log.h"
#include "core/network.h"
#include "core/test_link.h"
#include "core/tls.h"
#include "mail/alias.h"
#include "mail/queue_test_fixture.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {
namespace {

std::vector<std::string> reply_lines(const std::string& out) {
  std::vector<std::string> lines;
  for (std::size_t at = 0; at < out.size();) {
    std::size_t end = out.find("\r\n", at);
    if (end == std::string::npos) break;
    lines.push_back(out.substr(at, end - at));
    at = end + 2;
  }
  return lines;
}

class SmtpSessionTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    config.sock_buffer = 16384;
    write_file(root + "/users", "ann,x,Ann," + root + "/ann,0\n");
    write_file(root + "/groups", "#0\n");
    ASSERT_EQ(user_load(root + "/users"), 0);
    ASSERT_EQ(groups_load(root + "/groups"), 0);
    smtp_register();
  }

  std::unique_ptr<TestLink> open(Peer peer = {}) {
    auto link = std::make_unique<TestLink>(svc::smtp, std::move(peer));
    EXPECT_TRUE(link->take().starts_with("220 "));
    return link;
  }
  // The reply lines to `text`, fed in pieces of `piece` bytes.
  std::vector<std::string> say(TestLink& link, std::string_view text, std::size_t piece = 0) {
    link.feed(text, piece);
    return reply_lines(link.take());
  }
  void set_password(const std::string& name, const std::string& password) {
    ASSERT_EQ(user_set_password(name, password), UserChange::done);
  }
  void use_certificate() {
    ASSERT_EQ(tls_make_self_signed(root + "/cert.pem", root + "/key.pem", "mx.site.example"), "");
    config.tls_cert = root + "/cert.pem";
    config.tls_key = root + "/key.pem";
    ASSERT_EQ(tls_load(), TlsLoad::loaded);
  }
  std::vector<std::string> stored() { return folder_names(root + "/in", true); }
  std::vector<std::string> hidden() {
    std::vector<std::string> names;
    for (const std::string& n : folder_names(root + "/in"))
      if (n[0] == '.') names.push_back(n);
    return names;
  }
  std::string message_of(const std::string& path) {
    std::string data = read_file(path);
    return data.substr(data.find("\r\nX-Sender: ") + 2);
  }
};

const char* const kEnvelope = "MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\nDATA\r\n";

TEST_F(SmtpSessionTest, AMessageIsAcknowledgedOnlyOnceItsFileAndFolderAreSynced) {
  auto link = open();
  sysio::reset();
  EXPECT_EQ(say(*link, std::string(kEnvelope) + "Subject: s\r\n\r\nbody\r\n.\r\n").back(), "250 OK");
  EXPECT_EQ(sysio::count(sysio::Op::sync), 2u);  // syncfs, then the folder
  EXPECT_EQ(sysio::count(sysio::Op::rename), 1u);
  ASSERT_EQ(stored().size(), 1u);
  unlink(stored().front().c_str());
  // The queue file's write, the syncfs, the rename, the folder sync.
  for (auto [op, n] : {std::pair{sysio::Op::write, 1}, {sysio::Op::sync, 1}, {sysio::Op::rename, 1}, {sysio::Op::sync, 2}}) {
    sysio::reset();
    sysio::fail_nth(op, n);
    EXPECT_EQ(say(*link, std::string(kEnvelope) + "Subject: s\r\n\r\nbody\r\n.\r\n").back(),
              "451 Requested action aborted: local error in processing")
        << int(op) << n;
    EXPECT_EQ(stored(), std::vector<std::string>{}) << int(op) << n;
    EXPECT_EQ(hidden(), std::vector<std::string>{}) << int(op) << n;
  }
}

TEST_F(SmtpSessionTest, PipelinedCommandsInAnySplitAreAnsweredInOrder) {
  const std::string input = "HELO me\r\nMAIL FROM:<>\r\nRCPT TO:<ann@site.example>\r\nDATA\r\n"
                            "Subject: p\r\n\r\n.hidden\r\nbody\r\n.\r\nNOOP\r\nQUIT\r\n";
  for (std::size_t piece : {0, 1, 2, 5}) {
    auto link = std::make_unique<TestLink>(svc::smtp);
    link->feed(input, piece);
    auto lines = reply_lines(link->output());
    ASSERT_EQ(lines.size(), 8u) << piece;
    EXPECT_EQ(lines[1], "250 Hello me, how's life?");
    EXPECT_EQ(lines[2], "250 OK Sender accepted");
    EXPECT_EQ(lines[3], "250 OK Recipient syntactically correct");
    EXPECT_TRUE(lines[4].starts_with("354 "));
    EXPECT_EQ(lines[5], "250 OK");  // the commit came before the NOOP was read
    EXPECT_EQ(lines[6], "250 OK");
    EXPECT_TRUE(lines[7].starts_with("221 "));
    EXPECT_TRUE(link->closed());
    EXPECT_EQ(link->reason(), CloseReason::requested);
  }
  auto files = stored();
  ASSERT_EQ(files.size(), 4u);
  for (const auto& f : files) {
    EXPECT_NE(read_file(f).find("\r\nX-Sender: Unknown\r\n"), std::string::npos);
    // Dot lines stay stuffed as sent; the terminator is stored.
    EXPECT_TRUE(read_file(f).ends_with("\r\n\r\n.hidden\r\nbody\r\n.\r\n"));
  }
}

TEST_F(SmtpSessionTest, OverlongLinesAreRefusedAndTheTransactionSurvives) {
  auto link = open();
  EXPECT_EQ(say(*link, "MAIL FROM:<ann@far.example>\r\n"), std::vector<std::string>{"250 OK Sender accepted"});
  // 510 bytes without the line end is the longest line; one more is refused.
  EXPECT_EQ(say(*link, "NOOP" + std::string(506, ' ') + "\r\n"), std::vector<std::string>{"250 OK"});
  EXPECT_EQ(say(*link, "NOOP" + std::string(507, ' ') + "\r\n"), std::vector<std::string>{"500 Line too long"});
  // Far longer than the input buffer, in pieces: one refusal, nothing stalls.
  EXPECT_EQ(say(*link, "RCPT TO:<" + std::string(100000, 'x') + "@site.example>\r\n", 4093),
            std::vector<std::string>{"500 Line too long"});
  EXPECT_EQ(say(*link, "RCPT TO:<ann@site.example>\r\nDATA\r\nSubject: s\r\n\r\nok\r\n.\r\n"),
            (std::vector<std::string>{"250 OK Recipient syntactically correct",
                                      "354 Start mail input; end with <CRLF>.<CRLF>", "250 OK"}));
  EXPECT_EQ(read_file(stored().at(0)).find("RCPT TO:<x"), std::string::npos);
}

TEST_F(SmtpSessionTest, AClientThatPipelinesWithoutReadingCostsBoundedMemory) {
  auto link = open();
  link->peer_window(0);
  std::string noops;
  for (int i = 0; i < 20000; ++i) noops += "NOOP\r\n";
  link->feed(noops, 4096);
  EXPECT_LE(link->connection().pending(), Connection::kHighWater + 600);
  link->peer_window(std::numeric_limits<std::size_t>::max());
  auto lines = reply_lines(link->take());
  EXPECT_EQ(lines.size(), 20000u);
  EXPECT_EQ(std::set<std::string>(lines.begin(), lines.end()), std::set<std::string>{"250 OK"});
}

TEST_F(SmtpSessionTest, TheDataPhaseEdges) {
  auto link = open();
  // A terminator split so that one read ends in "\r\n." and the next begins "\r\n".
  link->feed(kEnvelope);
  link->take();
  EXPECT_EQ(say(*link, "Subject: split\r\n\r\nbody\r\n."), std::vector<std::string>{});
  EXPECT_EQ(say(*link, "\r\n"), std::vector<std::string>{"250 OK"});
  // No Date header: one is added as the last header line, also when the
  // header arrives in pieces.
  link->feed(kEnvelope);
  link->take();
  EXPECT_EQ(say(*link, "From: a@b\r\nSubject: undated\r\n\r\nx\r\n.\r\n", 3), std::vector<std::string>{"250 OK"});
  // Bare LF line ends are stored as CR LF; a line of two dots stays two dots.
  link->feed(kEnvelope);
  link->take();
  EXPECT_EQ(say(*link, "Subject: bare\nDate: Mon, 1 Jan 2024 00:00:00 +0000\n\n..\nend\n.\n"),
            std::vector<std::string>{"250 OK"});
  auto files = stored();
  ASSERT_EQ(files.size(), 3u);
  EXPECT_EQ(message_of(files[0]).substr(message_of(files[0]).find("\r\n\r\n")), "\r\n\r\nbody\r\n.\r\n");
  std::string undated = message_of(files[1]);
  std::string header = undated.substr(0, undated.find("\r\n\r\n"));
  EXPECT_TRUE(header.substr(header.rfind("\r\n") + 2).starts_with("Date: ")) << header;
  EXPECT_TRUE(message_of(files[2]).ends_with("\r\n\r\n..\r\nend\r\n.\r\n"));
  // A client that goes away in the middle leaves nothing behind.
  link->feed(kEnvelope);
  link->feed("Subject: cut\r\n\r\n" + std::string(50000, 'x') + "\r\nmore");
  link->vanish();
  EXPECT_EQ(link->reason(), CloseReason::peer_reset);
  EXPECT_EQ(stored().size(), 3u);
  EXPECT_EQ(hidden(), std::vector<std::string>{});
}

TEST_F(SmtpSessionTest, RsetAndQuit) {
  auto link = open();
  EXPECT_EQ(say(*link, "MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\nRSET\r\nDATA\r\n"),
            (std::vector<std::string>{"250 OK Sender accepted", "250 OK Recipient syntactically correct",
                                      "250 Reset OK", "503 Need MAIL before DATA"}));
  EXPECT_EQ(say(*link, "MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n").size(), 2u);
  EXPECT_EQ(hidden().size(), 1u);  // the transaction's file, not yet a message
  auto lines = say(*link, "QUIT\r\nNOOP\r\n");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_TRUE(lines[0].starts_with("221 ")) << lines[0];
  EXPECT_EQ(link->reason(), CloseReason::requested);
  EXPECT_EQ(stored(), std::vector<std::string>{});
  EXPECT_EQ(hidden(), std::vector<std::string>{});
  // A client that stops sending after its message still gets it committed
  // and answered before the close.
  auto other = open();
  other->feed(std::string(kEnvelope) + "Subject: last\r\n\r\nx\r\n.\r\n");
  other->finish();
  EXPECT_EQ(reply_lines(other->output()).back(), "250 OK");
  EXPECT_EQ(other->reason(), CloseReason::peer_closed);
  EXPECT_EQ(stored().size(), 1u);
}

TEST_F(SmtpSessionTest, TheAcceptRuleRefusesBlocksAndAsksStrangersToIdentify) {
  const Peer stranger{inet_addr("192.0.2.9"), 4000, "192.0.2.9"};
  config.smtp_block = address_list_parse("192.0.2.0/24");
  TestLink refused(svc::smtp, stranger);
  EXPECT_TRUE(refused.output().starts_with("421 "));
  EXPECT_TRUE(refused.output().ends_with(" connection refused\r\n"));
  EXPECT_TRUE(refused.closed());
  config.smtp_allow = address_list_parse("192.0.2.9");  // allow wins over block
  TestLink allowed(svc::smtp, stranger);
  EXPECT_TRUE(allowed.output().starts_with("220 "));

  config.smtp_allow.clear();
  config.smtp_block.clear();
  auto plain = open();
  EXPECT_EQ(say(*plain, "MAIL FROM:<made_up@site.example>\r\nRCPT TO:<ann@site.example>\r\n").back(),
            "250 OK Recipient syntactically correct");
  config.smtp_auth = address_list_parse("127.0.0.1");
  TestLink verify(svc::smtp);
  EXPECT_NE(verify.take().find("SMTP Server [ID verify] (v"), std::string::npos);
  EXPECT_EQ(say(verify, "MAIL FROM:<made_up@site.example>\r\nRCPT TO:<ann@site.example>\r\n").back(),
            "550 posting denied");
  // A local sender must prove it is that user; mail from outside comes as ever.
  EXPECT_EQ(say(verify, "MAIL FROM:<ann@site.example>\r\nRCPT TO:<ann@site.example>\r\n").back(),
            "550 posting denied");
  set_password("ann", "secret");
  EXPECT_EQ(say(verify, "RSET\r\nAUTH PLAIN AGFubgBzZWNyZXQ=\r\n").back(), "235 2.7.0 Authentication successful");
  for (const char* real : {"MAIL FROM:<someone@far.example>\r\n", "MAIL FROM:<ann@site.example>\r\n"})
    EXPECT_EQ(say(verify, std::string(real) + "RCPT TO:<ann@site.example>\r\n").back(),
              "250 OK Recipient syntactically correct");
}

// What a real client sees of the limit (552 at MAIL and at the end of the
// data) is tested end to end; here the parts no client shows.
TEST_F(SmtpSessionTest, EhloNamesItsExtensionsAndTheLimitCountsTheWholeQueueFile) {
  write_file(root + "/groups", "#0\n%mail.msg.size: 1\n");  // 1024 bytes for every stranger
  ASSERT_EQ(groups_load(root + "/groups"), 0);
  config.server_name = "mx.site.example";
  auto link = open();
  EXPECT_EQ(say(*link, "EHLO client.example\r\nEHLO\r\n"),
            (std::vector<std::string>{"250-mx.site.example Hello client.example, how's life?", "250-PIPELINING",
                                      "250-SIZE 1024", "250-8BITMIME", "250-HELP", "250 AUTH PLAIN LOGIN",
                                      "501 Syntax: EHLO hostname"}));
  EXPECT_EQ(say(*link, "HELP\r\n").back(), "214 Report problems to postmaster@site.example");
  EXPECT_EQ(say(*link, "MAIL FROM:<x@far.example> SIZE=12x\r\n"),
            std::vector<std::string>{"501 Syntax error in SIZE parameter"});
  // The envelope and the trace lines count: a 1000-byte message does not fit.
  std::string text = "Subject: s\r\n\r\n" + std::string(980, 'z') + "\r\n.\r\n";
  EXPECT_EQ(say(*link, std::string(kEnvelope) + text).back(), "552 Message size exceeds fixed maximum message size");
  EXPECT_EQ(hidden(), std::vector<std::string>{});
  // A group that overrides the limits has none.
  write_file(root + "/groups", "#0\n%mail.msg.size: 1\n%mail.override: yes\n");
  ASSERT_EQ(groups_load(root + "/groups"), 0);
  EXPECT_EQ(say(*link, "EHLO again\r\n")[2], "250-SIZE");
  EXPECT_EQ(say(*link, std::string(kEnvelope) + text).back(), "250 OK");
}

TEST_F(SmtpSessionTest, RecipientsAreCheckedAlongDebatchsRoute) {
  write_file(root + "/users", "ann,x,Ann Lee," + root + "/ann,0\nboss,x,Boss," + root + "/boss,1\n");
  write_file(root + "/groups", "#0\n#1\n%mail.override: yes\n");
  ASSERT_EQ(user_load(root + "/users"), 0);
  ASSERT_EQ(groups_load(root + "/groups"), 0);
  write_file(root + "/list", "ann\n");
  alias_table() = alias_parse("team ann,someone@far.example\nlist $" + root + "/list\nghost nosuchuser\n");
  auto link = open();
  say(*link, "MAIL FROM:<x@far.example>\r\n");
  for (const char* known : {"ann_box@site.example", "team@site.example", "list@localhost", "Postmaster@localhost",
                            "postmaster", "ann.lee@site.example", "a.lee@site.example", "nobody@site.example",
                            "someone@far.example"})
    EXPECT_EQ(say(*link, "RCPT TO:<" + std::string(known) + ">\r\n"),
              std::vector<std::string>{"250 OK Recipient syntactically correct"})
        << known;
  for (const char* unknown : {"nosuchuser@site.example", "ghost@localhost", "+1@site.example"})
    EXPECT_EQ(say(*link, "RCPT TO:<" + std::string(unknown) + ">\r\n"),
              std::vector<std::string>{"550 Unknown local user <" + std::string(unknown) + ">"});
  EXPECT_EQ(say(*link, "DATA\r\nSubject: s\r\n\r\nx\r\n.\r\n").back(), "250 OK");
  std::string file = read_file(stored().at(0));
  EXPECT_EQ(file.find("nosuchuser"), std::string::npos);
  EXPECT_EQ(file.find("+1"), std::string::npos);
  // Group mail from a sender whose group may reach a whole group.
  EXPECT_EQ(say(*link, "MAIL FROM:<boss@site.example>\r\nRCPT TO:<+0@site.example>\r\n").back(),
            "250 OK Recipient syntactically correct");
  alias_table().clear();
}

bool offers(const std::vector<std::string>& ehlo, const std::string& extension) {
  return std::any_of(ehlo.begin(), ehlo.end(), [&](const std::string& l) { return l.substr(4) == extension; });
}

TEST_F(SmtpSessionTest, StartTlsForgetsTheClearTextDialogue) {
  auto link = open();
  EXPECT_EQ(say(*link, "STARTTLS\r\n"), std::vector<std::string>{"454 4.7.0 TLS not available due to temporary reason"});
  use_certificate();
  set_password("ann", "secret");
  say(*link, "EHLO c\r\nAUTH PLAIN AGFubgBzZWNyZXQ=\r\nMAIL FROM:<x@far.example>\r\n");
  EXPECT_EQ(say(*link, "STARTTLS\r\n"), std::vector<std::string>{"220 2.0.0 Ready to start TLS"});
  EXPECT_EQ(hidden(), std::vector<std::string>{});  // the clear-text transaction is gone
  auto lines = say(*link, "MAIL FROM:<x@far.example>\r\nEHLO c\r\n");
  EXPECT_EQ(lines.front(), "503 5.5.1 Send EHLO first");
  EXPECT_FALSE(offers(lines, "STARTTLS"));
  EXPECT_EQ(say(*link, std::string(kEnvelope) + "Subject: s\r\n\r\nx\r\n.\r\n").back(), "250 OK");
  EXPECT_NE(read_file(stored().at(0)).find("Received: from 127.0.0.1\r\n\tby " + text_of(config.server_name) +
                                           " with ESMTPS (Velmor"),
            std::string::npos);
  // The AUTH before the upgrade counts for nothing.
  EXPECT_EQ(say(*link, "STARTTLS\r\nAUTH PLAIN AGFubgBzZWNyZXQ=\r\n"),
            (std::vector<std::string>{"503 5.5.1 TLS already active", "235 2.7.0 Authentication successful"}));
}

TEST_F(SmtpSessionTest, AuthChecksTheUserDatabaseAndAnswersAWrongPasswordLate) {
  set_password("ann", "secret");
  // A remote peer may not send a password in the clear, nor is it offered.
  TestLink remote(svc::smtp, Peer{inet_addr("192.0.2.9"), 4000, "192.0.2.9"});
  remote.take();
  EXPECT_FALSE(offers(say(remote, "EHLO c\r\n"), "AUTH PLAIN LOGIN"));
  EXPECT_EQ(say(remote, "AUTH PLAIN AGFubgBzZWNyZXQ=\r\n"),
            std::vector<std::string>{"538 5.7.11 Encryption required for requested authentication mechanism"});
  auto link = open();
  EXPECT_EQ(say(*link, "AUTH\r\nAUTH CRAM-MD5\r\nAUTH LOGIN\r\n*\r\nAUTH PLAIN\r\n%%%%\r\n"),
            (std::vector<std::string>{"501 5.5.4 Syntax: AUTH mechanism", "504 5.5.4 Unrecognized authentication type",
                                      "334 VXNlcm5hbWU6", "501 5.7.0 Authentication cancelled", "334 ",
                                      "501 5.5.2 Cannot decode response"}));
  // Wrong: a second late, the third ends the connection. PLAIN as another
  // identity than the name is refused like a wrong password.
  const std::string wrong[] = {"AUTH LOGIN YW5u\r\nd3Jvbmc=\r\n",      // ann / wrong
                               "AUTH PLAIN Ym9iAGFubgBzZWNyZXQ=\r\n",  // bob as ann / secret
                               "AUTH PLAIN AGFubgB3cm9uZw==\r\n"};     // ann / wrong
  for (int i = 0; i < 3; ++i) {
    link->feed(wrong[i] + "NOOP\r\n");
    EXPECT_EQ(reply_lines(link->take()).size(), i == 0 ? 1u : 0u);  // LOGIN's "Password:"
    link->advance(std::chrono::milliseconds(999));
    EXPECT_EQ(link->take(), "");
    link->advance(std::chrono::milliseconds(1));
    std::vector<std::string> late{"535 5.7.8 Authentication credentials invalid"};
    if (i < 2) late.push_back("250 OK");  // the third ends the connection
    EXPECT_EQ(reply_lines(link->take()), late);
  }
  EXPECT_EQ(link->reason(), CloseReason::requested);
  // Right, with LOGIN: once only; its messages name the user.
  auto good = open();
  EXPECT_EQ(say(*good, "AUTH LOGIN\r\nYW5u\r\nc2VjcmV0\r\nAUTH PLAIN AGFubgBzZWNyZXQ=\r\n"),
            (std::vector<std::string>{"334 VXNlcm5hbWU6", "334 UGFzc3dvcmQ6", "235 2.7.0 Authentication successful",
                                      "503 5.5.1 Already authenticated"}));
  EXPECT_EQ(say(*good, std::string(kEnvelope) + "Subject: s\r\n\r\nx\r\n.\r\n").back(), "250 OK");
  EXPECT_NE(read_file(stored().at(0)).find("Received: from 127.0.0.1 (authenticated as ann)\r\n\tby "),
            std::string::npos);
  EXPECT_NE(read_file(stored().at(0)).find(" with ESMTPA (Velmor"), std::string::npos);
}

TEST_F(SmtpSessionTest, CredentialsNeverReachTheMailLog) {
  log_parse("8 " + root + "/maillog\n");
  auto link = open();
  say(*link, "AUTH PLAIN AGFubgBzZWNyZXQ=\r\n");
  log_flush_all();
  std::string log = read_file(root + "/maillog");
  EXPECT_NE(log.find(" 127.0.0.1 - AUTH\n"), std::string::npos) << log;
  EXPECT_EQ(log.find("AGFubgBzZWNyZXQ"), std::string::npos);
  log_parse("");
}

}  // namespace
}  // namespace velmor
