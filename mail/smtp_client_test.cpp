// The SMTP client's session through the test driver (the server's side is
// the test's), and its runs against a resolver the test answers.
#include "mail/smtp_client.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "core/network.h"
#include "core/test_link.h"
#include "core/util.h"
#include "mail/queue_test_fixture.h"
#include "mail/smtp_reply.h"
#include "mail/smtp_server.h"

namespace velmor {
namespace {

class SmtpClientTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    queue_outgoing_entries().clear();  // entries another test left held
    config.server_name = "here.example";
    smtp_client_reset();
    smtp_client_register();
    link_up = 1;
  }
  void TearDown() override {
    smtp_client_reset();
    QueueFixture::TearDown();
  }
  // An outgoing queue file, listed.
  std::string queue(const std::string& name, const std::string& text, std::time_t mtime = 0) {
    std::string path = root + "/out/" + name;
    write_file(path, text);
    if (mtime) {
      const timespec times[2] = {{0, UTIME_OMIT}, {mtime, 0}};
      utimensat(AT_FDCWD, path.c_str(), times, 0);
    }
    queue_add_outgoing(path);
    return path;
  }
  static std::string message(const std::string& rcpts, const std::string& body = "Subject: hi\r\n\r\nhello\r\n") {
    std::string text = "MAIL FROM:<ann@site.example>\r\n";
    for (std::size_t at = 0; at < rcpts.size();) {
      std::size_t end = std::min(rcpts.find(',', at), rcpts.size());
      text += "RCPT TO:<" + rcpts.substr(at, end - at) + ">\r\n";
      at = end + 1;
    }
    return text + "DATA\r\n" + body + ".\r\n";
  }
  bool exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }
  // The error mails written to the incoming queue, whole.
  std::vector<std::string> error_mails() {
    std::vector<std::string> mails;
    for (const std::string& p : folder_names(root + "/in", true)) mails.push_back(read_file(p));
    return mails;
  }
  // A session of the "default" route, greeted and past HELO.
  std::unique_ptr<TestLink> greeted() {
    auto link = std::make_unique<TestLink>(smtp_turn_session());
    link->feed("220 there\r\n");
    EXPECT_EQ(link->take(), "EHLO here.example\r\n");
    link->feed("250 hi\r\n");
    return link;
  }
};

// However the server's replies are cut, each is acted on once it is whole;
// the file goes only after the reply to its final dot.
TEST_F(SmtpClientTest, RepliesAreReadWholeAndTheFileGoesOnlyAfterTheDot) {
  std::string path = queue("1", message("bob@far.example", "Subject: hi\r\n\r\n..dot\r\nend\r\n"));
  TestLink link(smtp_turn_session());
  link.feed("220-there\r\n220-more\r\n220 ready\r\n", 1);
  EXPECT_EQ(link.take(), "EHLO here.example\r\n");
  link.feed("250-hi\r\n250-8BITMIME\r\n250 SIZE\r\n", 4);
  EXPECT_EQ(link.take(), "MAIL FROM:<ann@site.example>\r\n");
  link.feed("250 ok\r", 1);
  link.feed("\n");
  EXPECT_EQ(link.take(), "RCPT TO:<bob@far.example>\r\n");
  link.feed("250 ok\r\n");
  EXPECT_EQ(link.take(), "DATA\r\n");
  link.feed("354 go\r\n");
  EXPECT_EQ(link.take(), "Subject: hi\r\n\r\n..dot\r\nend\r\n.\r\n");
  EXPECT_TRUE(exists(path));
  EXPECT_EQ(queue_outgoing().front().holder, 1);
  link.feed("250 queued\r\n");
  EXPECT_FALSE(exists(path));
  EXPECT_TRUE(queue_outgoing().empty());
  EXPECT_EQ(link.take(), "QUIT\r\n");
  link.feed("221 bye\r\n");
  EXPECT_TRUE(link.closed());
  EXPECT_EQ(smtp_client_count(), 0);
}

// Not a reply, a 421, or a connection lost before the dot's reply: the
// connection ends and the queue is as it was, its entries free again.
TEST_F(SmtpClientTest, AnythingButAReplyOr421EndsTheConnectionAndKeepsTheQueue) {
  const std::string text = message("bob@far.example");
  std::string path = queue("1", text);
  for (const char* bad : {"hello\r\n", "250-a\r\n251 b\r\n", "421 going down\r\n", ""}) {
    auto link = greeted();
    EXPECT_EQ(link->take(), "MAIL FROM:<ann@site.example>\r\n");
    link->feed("250 ok\r\n250 ok\r\n354 go\r\n");
    if (*bad) link->feed(bad);
    else link->vanish();
    EXPECT_TRUE(link->closed()) << bad;
    EXPECT_EQ(read_file(path), text);
    ASSERT_EQ(queue_outgoing().size(), 1u);
    EXPECT_EQ(queue_outgoing().front().holder, -1);
  }
  EXPECT_TRUE(error_mails().empty());
}

// Per recipient: 250 and 251 are delivered, 5xx goes back to the sender,
// 4xx stays queued alone, with its time of queueing kept. A 4xx or 5xx to
// the end of the data counts for every recipient that was accepted.
TEST_F(SmtpClientTest, EachRecipientIsSettledByItsOwnReply) {
  std::time_t queued = server_now - 3600;
  std::string path = queue("1", message("a@x.example,b@x.example,c@x.example,d@x.example"), queued);
  auto link = greeted();
  link->feed("250 ok\r\n250 ok\r\n251 forwarded\r\n550 no such user\r\n451 greylisted\r\n");
  EXPECT_EQ(link->take(),
            "MAIL FROM:<ann@site.example>\r\nRCPT TO:<a@x.example>\r\nRCPT TO:<b@x.example>\r\n"
            "RCPT TO:<c@x.example>\r\nRCPT TO:<d@x.example>\r\nDATA\r\n");
  link->feed("354 go\r\n");
  link->take();
  link->feed("250 ok\r\n");
  EXPECT_EQ(read_file(path), message("d@x.example"));
  EXPECT_EQ(file_mtime(path), queued);
  ASSERT_EQ(queue_outgoing().size(), 1u);
  EXPECT_EQ(queue_outgoing().front().recipients, "d@x.example");
  auto mails = error_mails();
  ASSERT_EQ(mails.size(), 1u);
  EXPECT_NE(mails[0].find("RCPT TO:<ann@site.example>"), std::string::npos);
  EXPECT_NE(mails[0].find("Remote server said after RCPT TO (c@x.example):\r\n550 no such user"),
            std::string::npos);
  EXPECT_EQ(mails[0].find("a@x.example"), std::string::npos);
  EXPECT_EQ(link->take(), "QUIT\r\n");  // the kept file is not tried again on this connection

  // The same file again: a 4xx after the dot keeps it whole; a 5xx returns it.
  link.reset();
  for (const char* end : {"452 full\r\n", "554 spam\r\n"}) {
    auto again = greeted();
    again->feed("250 ok\r\n250 ok\r\n354 go\r\n");
    again->take();
    again->feed(end);
    EXPECT_EQ(exists(path), end[0] == '4') << end;
  }
  mails = error_mails();
  ASSERT_EQ(mails.size(), 2u);
  EXPECT_TRUE(queue_outgoing().empty());
}

// Refusals before the data: 4xx to MAIL keeps, 5xx to DATA returns, and an
// RSET clears the transaction before the next message goes.
TEST_F(SmtpClientTest, RefusalsBeforeTheDataResetTheTransaction) {
  std::string first = queue("1", message("a@x.example"));
  std::string second = queue("2", message("b@x.example"));
  auto link = greeted();
  link->feed("451 later\r\n");
  EXPECT_EQ(link->take(), "MAIL FROM:<ann@site.example>\r\nRSET\r\n");
  link->feed("250 reset\r\n");
  link->feed("250 ok\r\n250 ok\r\n554 no data for you\r\n");
  EXPECT_EQ(link->take(), "MAIL FROM:<ann@site.example>\r\nRCPT TO:<b@x.example>\r\nDATA\r\nRSET\r\n");
  EXPECT_TRUE(exists(first));
  EXPECT_FALSE(exists(second));
  auto mails = error_mails();
  ASSERT_EQ(mails.size(), 1u);
  EXPECT_NE(mails[0].find("after DATA"), std::string::npos);
}

// A server that offers PIPELINING gets MAIL, RCPT and DATA at once; the
// replies are matched in order, and after a refused MAIL those behind it
// say nothing about the recipients. One that knows no EHLO gets HELO.
TEST_F(SmtpClientTest, PipelinedCommandsAreSettledByTheirRepliesInOrder) {
  std::string first = queue("1", message("a@x.example"));
  std::string second = queue("2", message("b@x.example,c@x.example"));
  TestLink link(smtp_turn_session());
  link.feed("220 there\r\n");
  EXPECT_EQ(link.take(), "EHLO here.example\r\n");
  link.feed("250-there\r\n250-PIPELINING\r\n250 8BITMIME\r\n");
  EXPECT_EQ(link.take(), "MAIL FROM:<ann@site.example>\r\nRCPT TO:<a@x.example>\r\nDATA\r\n");
  link.feed("451 try later\r\n503 need MAIL\r\n503 need RCPT\r\n");
  EXPECT_EQ(link.take(), "RSET\r\n");
  EXPECT_TRUE(exists(first));
  link.feed("250 ok\r\n");
  EXPECT_EQ(link.take(),
            "MAIL FROM:<ann@site.example>\r\nRCPT TO:<b@x.example>\r\nRCPT TO:<c@x.example>\r\nDATA\r\n");
  link.feed("250 ok\r\n550 unknown\r\n250 ok\r\n354 go\r\n", 3);
  EXPECT_EQ(link.take(), "Subject: hi\r\n\r\nhello\r\n.\r\n");
  link.feed("250 ok\r\n");
  EXPECT_FALSE(exists(second));
  EXPECT_EQ(error_mails().size(), 1u);
  EXPECT_TRUE(error_mails()[0].find("(b@x.example)") != std::string::npos);
  EXPECT_TRUE(error_mails()[0].find("(c@x.example)") == std::string::npos);

  TestLink old(smtp_turn_session());
  old.feed("220 there\r\n");
  old.feed("500 what?\r\n");
  EXPECT_EQ(old.take(), "EHLO here.example\r\nHELO here.example\r\n");
  old.feed("250 hi\r\n");
  EXPECT_EQ(old.take(), "QUIT\r\n");  // the first file is held by the other connection
}

// Only whole queue files go: the others move to oddments with their reason;
// the envelope is built from the parsed addresses; a lone "." line inside
// the message goes out as "..".
TEST_F(SmtpClientTest, OnlyWholeQueueFilesAreSentAndNoneEndsItsMessageEarly) {
  queue("1", "MAIL FROM:<ann@site.example>\r\nDATA\r\nno recipient\r\n.\r\n");
  queue("2", "MAIL FROM:<ann@site.example>\r\nRCPT TO:<b@x.example>\r\nno data line\r\n.\r\n");
  queue("3", "MAIL FROM:<ann@site.example>\r\nRCPT TO:<b@x.example>\r\nDATA\r\ncut short\r\n");
  std::string good = queue("4", "MAIL FROM: <ann@site.example> SIZE=5\r\nrcpt to:<b@x.example>\r\nDATA\r\n"
                                "Subject: s\r\n\r\n.\r\nRSET\r\n.\nQUIT\r\nlast\r\n.\r\n");
  auto link = greeted();
  EXPECT_EQ(link->take(), "MAIL FROM:<ann@site.example>\r\n");
  EXPECT_EQ(folder_names(root + "/odd").size(), 3u);
  link->feed("250 ok\r\n250 ok\r\n354 go\r\n");
  EXPECT_EQ(link->take(), "RCPT TO:<b@x.example>\r\nDATA\r\nSubject: s\r\n\r\n..\r\nRSET\r\n..\nQUIT\r\nlast\r\n.\r\n");
  link->feed("250 ok\r\n");
  EXPECT_FALSE(exists(good));
}

// Mail refused for now for 5 days after it was queued goes back to its sender.
TEST_F(SmtpClientTest, MailStillRefusedAfterFiveDaysGoesBack) {
  std::string path = queue("1", message("a@x.example"), server_now - 5 * 24 * 3600 - 1);
  auto link = greeted();
  link->feed("250 ok\r\n450 mailbox busy\r\n");
  EXPECT_FALSE(exists(path));
  auto mails = error_mails();
  ASSERT_EQ(mails.size(), 1u);
  EXPECT_NE(mails[0].find("5 days"), std::string::npos);
  EXPECT_NE(mails[0].find("450 mailbox busy"), std::string::npos);
}

// Two connections on one route at once never take the same entry.
TEST_F(SmtpClientTest, AnEntryTakenByOneConnectionIsNotSentByAnother) {
  queue("1", message("a@x.example"));
  queue("2", message("b@x.example"));
  auto one = greeted();
  auto two = greeted();
  EXPECT_EQ(one->take(), "MAIL FROM:<ann@site.example>\r\n");
  EXPECT_EQ(two->take(), "MAIL FROM:<ann@site.example>\r\n");
  one->feed("250 ok\r\n");
  two->feed("250 ok\r\n");
  EXPECT_EQ(one->take(), "RCPT TO:<a@x.example>\r\n");
  EXPECT_EQ(two->take(), "RCPT TO:<b@x.example>\r\n");
  EXPECT_EQ(smtp_client_count(), 2);
}

// Runs: one connection per route however often kicked; a direct domain
// goes to its mail exchangers in order and never to its own address when
// it has them; a domain that does not exist gets its mail back at once.
TEST_F(SmtpClientTest, RunsGoToTheRelayOrTheMailExchangersOncePerRoute) {
  config.smtp_hosts = "relay.example";
  config.smtp_direct = "direct.example, nxd.example, plain.example, nomail.example";
  std::vector<std::string> asked, mx_asked;
  std::vector<std::function<void(MxAnswer)>> mx_pending;
  net_set_resolver({.start = [&](std::string_view name, std::function<void(std::uint32_t)> done) {
                      asked.emplace_back(name);
                      done(0);
                      return std::uint64_t{0};
                    },
                    .cancel = [](std::uint64_t) {},
                    .mail_exchangers = [&](std::string_view domain, std::function<void(MxAnswer)> done) {
                      mx_asked.emplace_back(domain);
                      mx_pending.push_back(std::move(done));
                      return std::uint64_t{mx_pending.size()};
                    }});
  queue("1", message("a@far.example"));
  queue("2", message("b@direct.example"));
  std::string gone = queue("3", message("c@nxd.example"));
  queue("4", message("d@plain.example"));
  std::string refused = queue("5", message("e@nomail.example"));
  EXPECT_TRUE(hooks.smtpkick());
  EXPECT_FALSE(hooks.smtpkick());  // every route is being served
  EXPECT_EQ(hooks.smtp_client_count(), 5);
  EXPECT_EQ(mx_asked,
            (std::vector<std::string>{"direct.example", "nxd.example", "plain.example", "nomail.example"}));
  mx_pending[0]({MxResult::found, {"mx1.direct.example", "mx2.direct.example"}});
  mx_pending[1]({MxResult::no_such_domain, {}});
  mx_pending[2]({MxResult::none, {}});
  mx_pending[3]({MxResult::found, {""}});  // a null mail exchanger: no mail taken
  EXPECT_FALSE(exists(gone));
  EXPECT_FALSE(exists(refused));
  EXPECT_EQ(error_mails().size(), 2u);
  for (int i = 0; i < 10 && hooks.smtp_client_count() > 0; ++i) net_pass(0);
  EXPECT_EQ(hooks.smtp_client_count(), 0);
  std::sort(asked.begin(), asked.end());
  EXPECT_EQ(asked, (std::vector<std::string>{"mx1.direct.example", "mx2.direct.example", "plain.example",
                                             "relay.example"}));
  EXPECT_EQ(queue_outgoing().size(), 3u);
  // The poll leaves a route that just failed alone for a while; a kick does not.
  config.smtp_time = -1;
  smtp_client_poll();
  EXPECT_EQ(hooks.smtp_client_count(), 0);
  EXPECT_TRUE(hooks.smtpkick());
  ASSERT_EQ(mx_pending.size(), 6u);
  mx_pending[4]({MxResult::failed, {}});
  mx_pending[5]({MxResult::failed, {}});
  for (int i = 0; i < 10 && hooks.smtp_client_count() > 0; ++i) net_pass(0);
  EXPECT_EQ(hooks.smtp_client_count(), 0);
  // Every smtp.time minutes otherwise.
  config.smtp_time = 2;
  server_now += 119;
  smtp_client_poll();
  EXPECT_EQ(hooks.smtp_client_count(), 0);
  server_now += 2;
  smtp_client_poll();
  EXPECT_EQ(hooks.smtp_client_count(), 3);
  link_up = 0;
  smtp_client_reset();
  EXPECT_FALSE(hooks.smtpkick());
}

// TURN: a peer we relay for gets our queue over its own connection, after
// its greeting; anyone else keeps the refusal.
TEST_F(SmtpClientTest, TurnHandsTheQueueToAllowedPeersOnly) {
  queue("1", message("a@far.example"));
  config.smtp_allow = address_list_parse("10.1.2.3");
  smtp_register();
  Peer outsider{.ip = inet_addr("10.9.9.9"), .port = 1, .text = "10.9.9.9"};
  TestLink other(svc::smtp, outsider);
  other.take();
  other.feed("TURN\r\n");
  EXPECT_EQ(other.take(), "502 TURN not available\r\n");
  Peer allowed{.ip = inet_addr("10.1.2.3"), .port = 1, .text = "10.1.2.3"};
  TestLink link(svc::smtp, allowed);
  link.take();
  link.feed("HELO peer\r\nTURN\r\n220 peer ready\r\n");
  EXPECT_EQ(link.take(), "250 Hello peer, how's life?\r\n250 OK\r\nEHLO here.example\r\n");
  link.feed("250 hi\r\n");
  EXPECT_EQ(link.take(), "MAIL FROM:<ann@site.example>\r\n");
  EXPECT_EQ(smtp_client_count(), 1);
}

// smtp.hosts as it always was (a host) still names the relay; a login
// splits at the last '@' and the first ':' before it.
TEST(SmtpRelay, ParsesOldAndLoginForms) {
  SmtpRelay r;
  ASSERT_EQ(smtp_relay_parse(" relay.example, other", r), RelayParse::ok);
  EXPECT_EQ(r.host, "relay.example");
  EXPECT_EQ(r.port, 25);
  EXPECT_FALSE(r.login());
  ASSERT_EQ(smtp_relay_parse("ann@site:p@ss:w@relay.example:587", r), RelayParse::ok);
  EXPECT_EQ(r.user, "ann@site");
  EXPECT_EQ(r.password, "p@ss:w");
  EXPECT_EQ(r.host, "relay.example");
  EXPECT_EQ(r.port, 587);
  EXPECT_EQ(smtp_relay_parse(" \t", r), RelayParse::none);
  for (const char* bad : {"ann@relay", ":pw@relay", "a:b@", "relay:0", "relay:65536", "relay:2x", "relay:"})
    EXPECT_EQ(smtp_relay_parse(bad, r), RelayParse::bad) << bad;
}

// The password goes only after STARTTLS, to a certificate checked for the
// relay's name, and only by PLAIN or LOGIN; anything else ends the
// connection with the mail queued and nothing sent back to its sender.
TEST_F(SmtpClientTest, TheRelayLoginGoesOnlyUnderVerifiedTls) {
  const std::string text = message("bob@far.example");
  std::string path = queue("1", text);
  const SmtpRelay relay{"ann", "p@ss:w", "relay.example", 587};
  auto start = [&](std::string_view ehlo) {
    auto link = std::make_unique<TestLink>(smtp_client_session(relay));
    link->feed("220 there\r\n");
    EXPECT_EQ(link->take(), "EHLO here.example\r\n");
    link->feed(ehlo);
    return link;
  };
  auto secured = [&](std::string_view ehlo) {
    auto link = start("250-hi\r\n250-STARTTLS\r\n250 SIZE\r\n");
    EXPECT_EQ(link->take(), "STARTTLS\r\n");
    link->feed("220 go ahead\r\n");
    EXPECT_EQ(link->take(), "EHLO here.example\r\n");
    EXPECT_TRUE(link->connection().secure());
    EXPECT_EQ(link->tls_plan()->host, "relay.example");
    EXPECT_EQ(link->tls_plan()->verify, TlsVerify::peer);
    link->feed(ehlo);
    return link;
  };
  {
    auto link = secured("250-hi\r\n250-AUTH LOGIN PLAIN\r\n250 PIPELINING\r\n");
    EXPECT_EQ(link->take(), "AUTH PLAIN " + base64_encode(std::string("\0ann\0p@ss:w", 11)) + "\r\n");
    link->feed("235 welcome\r\n");
    EXPECT_EQ(link->take(), "MAIL FROM:<ann@site.example>\r\nRCPT TO:<bob@far.example>\r\nDATA\r\n");
  }
  {
    auto link = secured("250-hi\r\n250 AUTH=LOGIN\r\n");
    EXPECT_EQ(link->take(), "AUTH LOGIN\r\n");
    link->feed("334 VXNlcm5hbWU6\r\n");
    EXPECT_EQ(link->take(), base64_encode("ann") + "\r\n");
    link->feed("334 UGFzc3dvcmQ6\r\n");
    EXPECT_EQ(link->take(), base64_encode("p@ss:w") + "\r\n");
    link->feed("535 bad credentials\r\n");
    EXPECT_EQ(link->take(), "QUIT\r\n");
  }
  // STARTTLS refused, no usable mechanism (no STARTTLS at all and a failed
  // handshake are shown against real servers end to end).
  auto refused = start("250-hi\r\n250 STARTTLS\r\n");
  refused->feed("454 not now\r\n");
  EXPECT_EQ(refused->output(), "EHLO here.example\r\nSTARTTLS\r\nQUIT\r\n");
  auto strange = secured("250-hi\r\n250 AUTH CRAM-MD5\r\n");
  EXPECT_EQ(strange->take(), "QUIT\r\n");
  EXPECT_EQ(read_file(path), text);
  EXPECT_TRUE(error_mails().empty());
}

// Without a login, STARTTLS is taken when offered, unverified (as an MX
// would need), and mail still goes when the server will not start it.
TEST_F(SmtpClientTest, WithoutALoginTlsIsOpportunistic) {
  queue("1", message("bob@far.example"));
  const SmtpRelay relay{"", "", "mx.far.example", 25};
  {
    TestLink refused(smtp_client_session(relay));
    refused.feed("220 there\r\n250-hi\r\n250 STARTTLS\r\n454 no\r\n");
    EXPECT_EQ(refused.take(), "EHLO here.example\r\nSTARTTLS\r\nMAIL FROM:<ann@site.example>\r\n");
    EXPECT_FALSE(refused.tls_plan().has_value());
    refused.vanish();
  }
  TestLink link(smtp_client_session(relay));
  link.feed("220 there\r\n250-hi\r\n250 STARTTLS\r\n220 go\r\nstray bytes\r\n");
  EXPECT_EQ(link.take(), "EHLO here.example\r\nSTARTTLS\r\nEHLO here.example\r\n");
  EXPECT_EQ(link.tls_plan()->host, "mx.far.example");
  EXPECT_EQ(link.tls_plan()->verify, TlsVerify::none);
  link.feed("250 hi\r\n");
  EXPECT_EQ(link.take(), "MAIL FROM:<ann@site.example>\r\n");
}

TEST(SmtpReply, ContinuationLinesKeepTheirCode) {
  SmtpReply r;
  EXPECT_EQ(r.add("250-a"), ReplyRead::need_more);
  EXPECT_EQ(r.add("250"), ReplyRead::complete);
  EXPECT_EQ(r.text(), "250-a\n250");
  r.clear();
  EXPECT_EQ(r.add("250-a"), ReplyRead::need_more);
  EXPECT_EQ(r.add("251 b"), ReplyRead::malformed);
  for (const char* bad : {"25", "abc", "250x", "150 old", "650 no"}) {
    r.clear();
    EXPECT_EQ(r.add(bad), ReplyRead::malformed) << bad;
  }
  r.clear();
  for (std::size_t i = 0; i < SmtpReply::kMaxLines; ++i) ASSERT_EQ(r.add("220-" + std::string(100, 'x')), ReplyRead::need_more);
  EXPECT_EQ(r.add("220 last"), ReplyRead::malformed);
  EXPECT_LE(r.text().size(), SmtpReply::kMaxText);
}

}  // namespace
}  // namespace velmor
