// The POP3 session through the test driver (no sockets): a user with a
// real mailbox in a scratch home, the registered service, and a clock the
// test moves.
#include "mail/pop_server.h"

#include <arpa/inet.h>

#include <filesystem>
#include <limits>

#include "core/log.h"
#include "core/network.h"
#include "core/test_link.h"
#include "core/tls.h"
#include "mail/mailbox.h"
#include "mail/queue_test_fixture.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {
namespace {

constexpr const char* kSecretHash = "$1$7d1ZKX5F$d2aGUoNjVu30rj26rho90/";  // "secret"
const char* const kBadLogin = "-ERR Invalid username or password, please try again\r\n";

std::string message(int n, std::string_view body) {
  return mailbox_separator("MAIL FROM:<bob@far.example>", 1700000000) + "From: bob@far.example\r\nSubject: m" +
         std::to_string(n) + "\r\nStatus: RO\r\nX-Status:   \r\n\r\n" + std::string(body) + ".\r\n";
}

class PopSessionTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    home = root + "/alice";
    std::filesystem::create_directories(home + "/mail");
    write_file(root + "/users", "alice," + std::string(kSecretHash) + ",Alice Liddell," + home + ",0\n");
    write_file(root + "/groups", "#0\n%mail.pop.fetch: yes\n");
    ASSERT_EQ(user_load(root + "/users"), 0);
    ASSERT_EQ(groups_load(root + "/groups"), 0);
    mailbox_cache_clear();
    pop_register();
  }
  void TearDown() override {
    mailbox_cache_clear();
    QueueFixture::TearDown();
  }
  void mailbox(const std::vector<std::string>& messages) {
    std::string text;
    for (const auto& m : messages) text += m;
    write_file(home + "/mail/inbox", text);
  }
  std::unique_ptr<TestLink> login() {
    auto link = std::make_unique<TestLink>(svc::pop);
    EXPECT_TRUE(link->take().starts_with("+OK "));
    link->feed("USER alice\r\nPASS secret\r\n");
    std::string out = link->take();
    EXPECT_TRUE(out.starts_with("+OK please send PASS command\r\n+OK ")) << out;
    return link;
  }
  std::string say(TestLink& link, std::string_view text, std::size_t piece = 0) {
    link.feed(text, piece);
    return link.take();
  }
  std::string home;
};

// A message as POP3 sends it: from behind its separator line.
std::string stored(int n, std::string_view body) {
  std::string m = message(n, body);
  return m.substr(m.find("\r\n") + 2);
}

TEST_F(PopSessionTest, RetrTopDeleAndQuit) {
  const std::string body = "Hello.\r\n..dot line\r\nStatus: RO\r\n\r\nlast\r\n";
  mailbox({message(1, body), message(2, "short\r\n")});
  const std::size_t one = stored(1, body).size(), two = stored(2, "short\r\n").size();
  auto link = login();
  EXPECT_EQ(say(*link, "STAT\r\n"), "+OK 2 " + std::to_string(one + two) + "\r\n");
  EXPECT_EQ(say(*link, "RETR 1\r\n", 3), "+OK " + std::to_string(one) + " octets\r\n" + stored(1, body));
  // TOP: the header without the mailbox's own status lines, the empty
  // line, the lines asked for, and the end.
  const std::string top = "From: bob@far.example\r\nSubject: m1\r\n\r\nHello.\r\n..dot line\r\n";
  EXPECT_EQ(say(*link, "TOP 1 2\r\n"), "+OK " + std::to_string(top.size()) + " octets\r\n" + top + ".\r\n");
  EXPECT_EQ(say(*link, "DELE 1\r\nRETR 1\r\nLIST\r\n"),
            "+OK message 1 deleted\r\n-ERR message does not exist or has been deleted\r\n+OK 1 messages (" +
                std::to_string(two) + " octets)\r\n2 " + std::to_string(two) + "\r\n.\r\n");
  EXPECT_TRUE(say(*link, "QUIT\r\nNOOP\r\n").ends_with("shutdown (1 messages left)\r\n"));
  EXPECT_EQ(link->reason(), CloseReason::requested);
  EXPECT_EQ(read_file(home + "/mail/inbox"), message(2, "short\r\n"));
}

TEST_F(PopSessionTest, RsetUndeletesAndADroppedSessionDeletesNothing) {
  mailbox({message(1, "a\r\n"), message(2, "b\r\n"), message(3, "c\r\n")});
  const std::string before = read_file(home + "/mail/inbox");
  auto link = login();
  EXPECT_EQ(say(*link, "DELE 2\r\nRSET\r\nSTAT\r\n").substr(0, 23), "+OK message 2 deleted\r\n");
  EXPECT_TRUE(say(*link, "QUIT\r\n").ends_with("shutdown (3 messages left)\r\n"));
  auto other = login();
  say(*other, "DELE 1\r\nDELE 3\r\n");
  // The mailbox is used by one session at a time, and the mark goes with
  // the connection however it ends.
  TestLink second(svc::pop);
  second.take();
  EXPECT_EQ(say(second, "USER alice\r\nPASS secret\r\nSTAT\r\n"),
            "+OK please send PASS command\r\n"
            "-ERR [IN-USE] mailbox already in use: another POP or IMAP session is currently active\r\n");
  other->vanish();
  EXPECT_EQ(other->reason(), CloseReason::peer_reset);
  EXPECT_TRUE(say(second, "USER alice\r\nPASS secret\r\n").ends_with("+OK 3 messages waiting for alice\r\n"));
  EXPECT_EQ(read_file(home + "/mail/inbox"), before);
}

// A damaged mailbox (a message whose "." line is missing, or a lone "."
// line inside one) never ends a reply early or leaves it without its end.
TEST_F(PopSessionTest, DamagedMessagesAreSentWholeAndEnded) {
  struct Case {
    std::string stored, sent;
  } cases[] = {
      {"a\r\n.\r\nb\r\n.\r\n", "a\r\n..\r\nb\r\n"},
      {".\n..\r\n.\r\n.\r\n.\r\n", "..\n..\r\n..\r\n..\r\n"},
      {"a\r\nb", "a\r\nb\r\n"},
      {"a\r\n.", "a\r\n"},
      {"a\r\n.\n", "a\r\n"},
      {"", ""},
  };
  for (const Case& k : cases) {
    const std::string head = "Subject: x\r\n\r\n";
    write_file(home + "/mail/inbox", mailbox_separator("MAIL FROM:<b@far.example>", 1700000000) + head + k.stored);
    std::filesystem::remove(home + "/mail/overview/inbox");
    mailbox_cache_clear();
    auto link = login();
    std::string retr = say(*link, "RETR 1\r\n");
    EXPECT_EQ(retr.substr(retr.find("\r\n") + 2), head + k.sent + ".\r\n") << k.stored;
    std::string top = say(*link, "TOP 1 9\r\n");
    EXPECT_EQ(top.substr(top.find("\r\n") + 2), head + k.sent + ".\r\n") << k.stored;
    say(*link, "QUIT\r\n");
  }
}

TEST_F(PopSessionTest, AFailedPasswordIsAnsweredASecondLateAndTheThirdEndsTheSession) {
  mailbox({message(1, "a\r\n")});
  TestLink link(svc::pop);
  link.take();
  // The NOOP behind the wrong password waits for the late answer.
  EXPECT_EQ(say(link, "USER alice\r\nPASS wrong\r\nNOOP\r\n"), "+OK please send PASS command\r\n");
  link.advance(std::chrono::milliseconds(999));
  EXPECT_EQ(link.take(), "");
  link.advance(std::chrono::milliseconds(1));
  EXPECT_EQ(link.take(), std::string(kBadLogin) + "+OK\r\n");
  say(link, "USER alice\r\nPASS wrong\r\n");
  link.advance(std::chrono::seconds(1));
  EXPECT_EQ(link.take(), kBadLogin);
  say(link, "USER nobody\r\nPASS secret\r\nNOOP\r\n");
  link.advance(std::chrono::seconds(1));
  EXPECT_EQ(link.take(), kBadLogin);
  EXPECT_EQ(link.reason(), CloseReason::requested);
}

TEST_F(PopSessionTest, OverlongLinesLongVerbsAndLineEnds) {
  mailbox({message(1, "a\r\n")});
  TestLink link(svc::pop);
  link.take();
  // Longer than the input buffer, in pieces: refused once, then served.
  EXPECT_EQ(say(link, "USER " + std::string(100000, 'b') + "\r\nNOOP\r\n", 4000),
            "-ERR Bad command - too long\r\n+OK\r\n");
  // A ten-letter verb throws the rest of what is buffered away.
  EXPECT_EQ(say(link, "ABCDEFGHIJ\r\nNOOP\r\nNOOP\r\n"), "-ERR Bad command - too long\r\n");
  // A bare CR ends a line; its LF may come later.
  EXPECT_EQ(say(link, "NOOP\r"), "+OK\r\n");
  EXPECT_EQ(say(link, "\nNOOP\r\n"), "+OK\r\n");
  EXPECT_EQ(say(link, "\r\n"), "-ERR Bad command\r\n");
}

// The list itself is checked with a real client; here that it is the same
// in every state, and that a login is logged with the client's address.
TEST_F(PopSessionTest, CapaInEveryStateAndTheLoginLogNamesTheClient) {
  mailbox({message(1, "a\r\n")});
  log_parse("2 " + root + "/main\n");
  log_mask = logfac::pop;
  TestLink link(svc::pop);
  link.take();
  std::string capa = say(link, "CAPA\r\n");
  EXPECT_TRUE(capa.starts_with("+OK ") && capa.ends_with("\r\n.\r\n")) << capa;
  EXPECT_EQ(say(link, "USER alice\r\ncapa\r\n"), "+OK please send PASS command\r\n" + capa);
  EXPECT_EQ(say(link, "PASS secret\r\nCAPA\r\n"), "+OK 1 messages waiting for alice\r\n" + capa);
  log_flush_all();
  EXPECT_NE(read_file(root + "/main").find("Login:alice from 127.0.0.1"), std::string::npos) << read_file(root + "/main");
  log_parse("");
}

// A listing far longer than the output's high-water mark, to a client that
// does not read: produced part by part as the output drains, and the
// command behind it waits its turn.
TEST_F(PopSessionTest, LongListingsFollowTheOutputAndPipelinedRetrievalsStayInOrder) {
  std::vector<std::string> messages;
  for (int i = 1; i <= 6000; ++i) messages.push_back(message(i, "body " + std::to_string(i) + "\r\n"));
  mailbox(messages);
  auto link = login();
  link->peer_window(0);
  link->feed("UIDL\r\nSTAT\r\n");
  EXPECT_LE(link->connection().pending(), Connection::kHighWater + 64 * 1024);
  link->peer_window(std::numeric_limits<std::size_t>::max());
  std::string out = link->take();
  ASSERT_TRUE(out.starts_with("+OK\r\n1 1\r\n2 2\r\n")) << out.substr(0, 100);
  EXPECT_NE(out.find("\r\n6000 6000\r\n.\r\n+OK 6000 "), std::string::npos);
  // RETRs pipelined behind a DELE and QUIT: the messages come out whole,
  // although the mailbox was rewritten before their bytes were sent.
  link->peer_window(0);
  link->feed("RETR 1\r\nRETR 5999\r\nDELE 1\r\nDELE 5999\r\nQUIT\r\n");
  link->peer_window(std::numeric_limits<std::size_t>::max());
  out = link->take();
  EXPECT_NE(out.find("Subject: m1\r\nStatus: RO\r\nX-Status:   \r\n\r\nbody 1\r\n.\r\n+OK"), std::string::npos);
  EXPECT_NE(out.find("Subject: m5999\r\nStatus: RO\r\nX-Status:   \r\n\r\nbody 5999\r\n.\r\n+OK"), std::string::npos);
  EXPECT_TRUE(out.ends_with("shutdown (5998 messages left)\r\n"));
  EXPECT_TRUE(link->closed());
}

}  // namespace
}  // namespace velmor

namespace velmor {
namespace {

// STLS: offered and accepted only before login while a certificate is
// loaded; what the client pipelined behind it is never run, and a user name
// given in the clear is forgotten.
TEST_F(PopSessionTest, StlsUpgradesBeforeLoginOnlyDropsPipelinedInputAndForgetsTheUser) {
  mailbox({message(1, "a\r\n")});
  TestLink off(svc::pop);
  off.take();
  EXPECT_EQ(say(off, "CAPA\r\n").find("STLS"), std::string::npos);
  EXPECT_EQ(say(off, "STLS\r\n"), "-ERR TLS is not available on this server\r\n");
  EXPECT_FALSE(off.connection().secure());

  config.tls_cert = root + "/cert.pem";
  config.tls_key = root + "/key.pem";
  ASSERT_EQ(tls_make_self_signed(root + "/cert.pem", root + "/key.pem", "mail.example.test"), "");
  ASSERT_EQ(tls_load(), TlsLoad::loaded);
  TestLink link(svc::pop);
  link.take();
  std::string capa = say(link, "CAPA\r\n");
  EXPECT_NE(capa.find("\r\nUSER\r\nSTLS\r\n"), std::string::npos) << capa;
  EXPECT_EQ(say(link, "USER alice\r\nSTLS\r\nPASS secret\r\nQUIT\r\n"),
            "+OK please send PASS command\r\n+OK Begin TLS negotiation\r\n");
  EXPECT_TRUE(link.connection().secure());
  EXPECT_FALSE(link.closed());
  EXPECT_EQ(say(link, "PASS secret\r\n"), "-ERR Invalid command; valid commands:  USER,  QUIT\r\n");
  EXPECT_EQ(say(link, "CAPA\r\n").find("STLS"), std::string::npos);
  EXPECT_EQ(say(link, "STLS\r\n"), "-ERR Already using TLS\r\n");
  EXPECT_EQ(say(link, "USER alice\r\nPASS secret\r\n"),
            "+OK please send PASS command\r\n+OK 1 messages waiting for alice\r\n");
  say(link, "QUIT\r\n");

  auto plain = login();
  EXPECT_EQ(say(*plain, "STLS\r\nSTAT\r\n"), "-ERR STLS is only allowed before login\r\n+OK 1 70\r\n");
}

// With tls.plain.login off, a peer outside the local networks cannot send a
// password unencrypted: USER is refused (so PASS never follows), and is
// neither looked up nor logged. Loopback, the private ranges and TLS may.
TEST_F(PopSessionTest, PlainLoginIsRefusedToStrangersOnlyWhenSwitchedOffUntilTls) {
  mailbox({message(1, "a\r\n")});
  log_parse("2 " + root + "/main\n");
  log_mask = logfac::pop;
  const Peer stranger{inet_addr("192.0.2.9"), 4000, "192.0.2.9"};
  const Peer neighbour{inet_addr("172.16.4.4"), 4000, "172.16.4.4"};
  TestLink allowed(svc::pop, stranger);
  allowed.take();
  EXPECT_EQ(say(allowed, "USER alice\r\n"), "+OK please send PASS command\r\n");

  config.tls_plain_login = false;
  TestLink local(svc::pop, neighbour);
  local.take();
  EXPECT_EQ(say(local, "USER alice\r\nPASS secret\r\n"),
            "+OK please send PASS command\r\n+OK 1 messages waiting for alice\r\n");
  say(local, "QUIT\r\n");

  TestLink link(svc::pop, stranger);
  link.take();
  EXPECT_EQ(say(link, "CAPA\r\n").find("USER"), std::string::npos);
  EXPECT_EQ(say(link, "USER alice\r\nPASS secret\r\n"),
            "-ERR [AUTH] Use STLS first: passwords are not accepted unencrypted from outside the local network\r\n"
            "-ERR Invalid command; valid commands:  USER,  QUIT\r\n");
  log_flush_all();
  EXPECT_EQ(read_file(root + "/main").find("192.0.2.9"), std::string::npos) << read_file(root + "/main");
  link.connection().start_tls();
  link.turn();
  ASSERT_TRUE(link.connection().secure());
  EXPECT_NE(say(link, "CAPA\r\n").find("\r\nUSER\r\n"), std::string::npos);
  EXPECT_EQ(say(link, "USER alice\r\nPASS secret\r\n"),
            "+OK please send PASS command\r\n+OK 1 messages waiting for alice\r\n");
  log_parse("");
}

}  // namespace
}  // namespace velmor
