// The POP3 client through the test driver: the test plays the server, line
// by line, and the queue is a scratch folder whose syncs the file seam
// counts and fails.
#include "mail/pop_client.h"

#include <algorithm>
#include <filesystem>

#include "core/connection.h"
#include "core/hooks.h"
#include "core/network.h"
#include "core/test_link.h"
#include "core/util.h"
#include "mail/queue_test_fixture.h"
#include "mail/queue_text.h"

namespace velmor {
namespace {

TEST(PopAccounts, ParseWithoutLoss) {
  const std::string long_user(40, 'u'), long_password(40, 'p');
  auto a = pop_accounts_parse(" -ann:secret@pop.one.example , *bob@site.example:p@ss:w@pop.two.example:1110\r\n" +
                              long_user + ":" + long_password + "@h\n" +
                              "no-colon@h, :nouser@h, x:y@, x:y@h:0, x:y@h:99999, x:y@h:11o, x:y@h\t:110");
  ASSERT_EQ(a.size(), 3u);
  EXPECT_TRUE(a[0].keep);
  EXPECT_EQ(a[0].user, "ann");
  EXPECT_EQ(a[0].password, "secret");
  EXPECT_EQ(a[0].host, "pop.one.example");
  EXPECT_EQ(a[0].port, 110);
  // The host follows the last '@': the user and the password may hold one.
  EXPECT_FALSE(a[1].keep);
  EXPECT_EQ(a[1].user, "bob@site.example");
  EXPECT_EQ(a[1].password, "p@ss:w");
  EXPECT_EQ(a[1].host, "pop.two.example");
  EXPECT_EQ(a[1].port, 1110);
  EXPECT_EQ(a[2].user, long_user);
  EXPECT_EQ(a[2].password, long_password);
  std::string shown = pop_accounts_show(a);
  EXPECT_EQ(shown.substr(0, shown.find('\n')), "-*ann:secret@pop.one.example");
  EXPECT_EQ(pop_accounts_show(pop_accounts_parse(shown)), shown);
}

// The TLS forms: a scheme after the marks, its own default port.
TEST(PopAccounts, SchemesAskForTls) {
  auto a = pop_accounts_parse("-POP3S://ann:pw@isp.example, pop3+stls://bob:p:w@isp.example:1110,"
                              "pop3s://cy:pw@isp.example:110, pop3://dee:pw@isp.example");
  ASSERT_EQ(a.size(), 4u);
  EXPECT_TRUE(a[0].keep);
  EXPECT_EQ(a[0].tls, PopTls::implicit);
  EXPECT_EQ(a[0].user, "ann");
  EXPECT_EQ(a[0].port, 995);
  EXPECT_EQ(a[1].tls, PopTls::stls);
  EXPECT_EQ(a[1].password, "p:w");
  EXPECT_EQ(a[1].port, 1110);
  EXPECT_EQ(a[2].port, 110);
  EXPECT_EQ(a[3].tls, PopTls::none);
  EXPECT_EQ(a[3].user, "dee");
  std::string shown = pop_accounts_show(a);
  EXPECT_EQ(shown, "-*pop3s://ann:pw@isp.example\n*pop3+stls://bob:p:w@isp.example:1110\n"
                   "*pop3s://cy:pw@isp.example:110\n*dee:pw@isp.example\n");
  EXPECT_EQ(pop_accounts_show(pop_accounts_parse(shown)), shown);
}

// The server's side of a login; with `pipelining` its CAPA offers it. Its
// messages are listed as 10 bytes each, with the UIDLs u<first>, u<first + 1> ...
std::string login(bool pipelining, int messages, int first = 1) {
  std::string out = "+OK ready\r\n+OK\r\n+OK\r\n" +
                    std::string(pipelining ? "+OK\r\nUIDL\r\nPIPELINING\r\n.\r\n" : "-ERR\r\n") + "+OK " +
                    std::to_string(messages) + " 999\r\n";
  if (messages == 0) return out;
  std::string list = "+OK\r\n", uidl = "+OK\r\n";
  for (int n = 1; n <= messages; ++n) {
    list += std::to_string(n) + " 10\r\n";
    uidl += std::to_string(n) + " u" + std::to_string(first + n - 1) + "\r\n";
  }
  return out + list + ".\r\n" + uidl + ".\r\n";
}
// What the client says up to its listings.
const std::string kLoggedIn = "USER acct\r\nPASS secret\r\nCAPA\r\nSTAT\r\nLIST\r\nUIDL\r\n";

class PopClientTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    config.server_name = "site.example";
    server_now = 1700000000;
    pop_client_register();
  }
  std::unique_ptr<TestLink> connect(bool keep = false) {
    PopAccount a{"acct", "secret", "pop.isp.example", 110, keep};
    return std::make_unique<TestLink>(pop_client_session(a));
  }
  // The queue files (numbered) and every other file the folder holds.
  std::vector<std::string> queued() { return folder_names(root + "/in", true); }
  std::vector<std::string> everything() { return folder_names(root + "/in"); }
  std::string stored(std::string_view message) {
    return "POP3 MAIL FROM:<acct@pop.isp.example>\r\nRCPT TO:<acct@pop.isp.example>\r\nDATA\r\n"
           "Received: from pop.isp.example [127.0.0.1]\r\n\tby site.example with POP3 (Velmor 2.0.49);\r\n\t" +
           mail_date_text(server_now) + "\r\n" + std::string(message);
  }
};

TEST_F(PopClientTest, MessagesEndAtTheirTerminatorAndAreDeletedOnlyOnceCommitted) {
  auto link = connect();
  link->feed(login(true, 3), 3);
  EXPECT_EQ(link->take(), kLoggedIn + "RETR 3\r\nRETR 2\r\nRETR 1\r\n");
  // Sizes announced wrongly or not at all, a body line that looks like a
  // reply, a stuffed dot, and an empty message.
  const std::string three = "Subject: three\r\n\r\n+OK 5\r\n..dot\r\n.\r\n";
  const std::string two = "Subject: two\r\n\r\nbody\r\n.\r\n";
  sysio::reset();
  link->feed("+OK 5 octets\r\n" + three + "+OK\r\n" + two + "+OK 100\r\n.\r\n", 7);
  // One commit for the three (a sync of the file system, one of the folder),
  // then their deletions, pipelined with QUIT behind the record of their
  // UIDLs (its file synced, and its folder).
  EXPECT_EQ(sysio::count(sysio::Op::sync), 4u);
  EXPECT_EQ(link->take(), "DELE 3\r\nDELE 2\r\nDELE 1\r\nQUIT\r\n");
  std::vector<std::string> files = queued();
  ASSERT_EQ(files.size(), 3u);
  EXPECT_EQ(read_file(files[0]), stored(three));
  EXPECT_EQ(read_file(files[1]), stored(two));
  EXPECT_EQ(read_file(files[2]), stored(".\r\n"));
  EXPECT_EQ(everything().size(), 3u);  // no hidden file left behind
  EXPECT_EQ(queue_incoming().size(), 3u);
  link->feed("+OK\r\n+OK\r\n+OK\r\n+OK bye\r\n");
  EXPECT_TRUE(link->closed());
  EXPECT_EQ(link->reason(), CloseReason::requested);
}

TEST_F(PopClientTest, WithoutPipeliningOneCommandAtATimeAndSeveralMessagesShareACommit) {
  auto link = connect();
  link->feed(login(false, 3));
  EXPECT_EQ(link->take(), kLoggedIn + "RETR 3\r\n");
  sysio::reset();
  link->feed("+OK\r\nSubject: 3\r\n\r\n.\r\n");
  EXPECT_EQ(link->take(), "RETR 2\r\n");
  link->feed("-ERR no such message\r\n");  // skipped, the others still come
  EXPECT_EQ(link->take(), "RETR 1\r\n");
  EXPECT_EQ(sysio::count(sysio::Op::sync), 0u);  // nothing committed, nothing deleted yet
  link->feed("+OK\r\nSubject: 1\r\n\r\n.\r\n");
  EXPECT_EQ(sysio::count(sysio::Op::sync), 2u);
  EXPECT_EQ(link->take(), "DELE 3\r\n");
  link->feed("+OK\r\n");
  EXPECT_EQ(link->take(), "DELE 1\r\n");
  link->feed("+OK\r\n");
  EXPECT_EQ(link->take(), "QUIT\r\n");
  EXPECT_EQ(queued().size(), 2u);
}

TEST_F(PopClientTest, NothingIsDeletedThatIsNotSafelyQueued) {
  // The commit's sync fails: no file, no DELE, and no more asked for.
  auto link = connect();
  link->feed(login(true, 2));
  link->take();
  sysio::fail_nth(sysio::Op::sync, 1);
  link->feed("+OK\r\nSubject: 2\r\n\r\n.\r\n+OK\r\nSubject: 1\r\n\r\n.\r\n");
  EXPECT_EQ(link->take(), "QUIT\r\n");
  EXPECT_TRUE(everything().empty());

  // A write fails (the disk is full): that message is dropped, the one
  // before it still committed and deleted, nothing further asked for.
  sysio::reset();
  auto second = connect();
  second->feed(login(false, 3));
  second->take();
  second->feed("+OK\r\nSubject: 3\r\n\r\n.\r\n");
  EXPECT_EQ(second->take(), "RETR 2\r\n");
  sysio::fail_nth(sysio::Op::write, 1);
  second->feed("+OK\r\nSubject: 2\r\n\r\n.\r\n");
  EXPECT_EQ(second->take(), "DELE 3\r\n");
  second->feed("+OK\r\n");
  EXPECT_EQ(second->take(), "QUIT\r\n");
  ASSERT_EQ(queued().size(), 1u);
  EXPECT_EQ(read_file(queued()[0]), stored("Subject: 3\r\n\r\n.\r\n"));
  EXPECT_EQ(everything().size(), 1u);
}

TEST_F(PopClientTest, ADroppedConnectionLeavesNoPartialFileAndDeletesNothing) {
  // Dropped with a whole message waiting for its batch: nothing was
  // deleted for it, so it is dropped too (the next run fetches it).
  auto second = connect();
  second->feed(login(false, 2));
  second->take();
  second->feed("+OK\r\nSubject: 2\r\n\r\n.\r\n");
  EXPECT_EQ(second->take(), "RETR 1\r\n");
  second->finish();
  EXPECT_TRUE(second->closed());
  EXPECT_TRUE(everything().empty());
  EXPECT_EQ(second->output().find("DELE"), std::string::npos);

  // A server that stops half way through a message: the loop's time-out
  // ends it the same way.
  auto third = connect();
  third->feed(login(true, 1));
  third->feed("+OK\r\nSubject: 1\r\n\r\nhalf");
  third->connection().close_now(CloseReason::timed_out);
  EXPECT_TRUE(third->closed());
  EXPECT_TRUE(everything().empty());
}

// The UIDLs of queued messages are kept per account, so a session cut
// before QUIT's answer (the server then deletes nothing) never brings them
// twice: the next one deletes them unfetched, an account that keeps its
// mail skips them, and those the server no longer lists are forgotten.
TEST_F(PopClientTest, MessagesQueuedBeforeAreDeletedNotFetchedAndForgottenOnceGone) {
  const std::string state_file = root + "/pop/" + md5_hex("acct\npop.isp.example:110");
  const std::string header = "# messages of acct@pop.isp.example:110 already queued\n";
  auto first = connect();
  first->feed(login(true, 3));
  first->take();
  // The record's sync fails (the commit's two syncs come first): it is
  // written again when the session ends.
  sysio::fail_nth(sysio::Op::sync, 3);
  first->feed("+OK\r\nSubject: 3\r\n\r\n.\r\n+OK\r\nSubject: 2\r\n\r\n.\r\n+OK\r\nSubject: 1\r\n\r\n.\r\n");
  EXPECT_EQ(first->take(), "DELE 3\r\nDELE 2\r\nDELE 1\r\nQUIT\r\n");
  EXPECT_FALSE(std::filesystem::exists(state_file));
  first->finish();
  EXPECT_EQ(read_file(state_file), header + "u1\nu2\nu3\n");

  auto second = connect();
  second->feed(login(true, 4));
  EXPECT_EQ(second->take(), kLoggedIn + "DELE 3\r\nDELE 2\r\nDELE 1\r\nRETR 4\r\n");
  second->feed("+OK\r\n+OK\r\n+OK\r\n+OK\r\nSubject: 4\r\n\r\n.\r\n");
  EXPECT_EQ(second->take(), "DELE 4\r\nQUIT\r\n");
  EXPECT_EQ(queued().size(), 4u);

  auto kept = connect(true);
  kept->feed(login(true, 4));
  EXPECT_EQ(kept->take(), kLoggedIn + "QUIT\r\n");

  // A message announced over the limit (64 MB when the default group sets
  // none) is left on the server.
  auto fourth = connect();
  fourth->feed("+OK ready\r\n+OK\r\n+OK\r\n+OK\r\nPIPELINING\r\n.\r\n+OK 2 999\r\n+OK\r\n1 10\r\n2 67108865\r\n.\r\n"
               "+OK\r\n1 u9\r\n2 u10\r\n.\r\n+OK\r\nSubject: 9\r\n\r\n.\r\n");
  EXPECT_EQ(fourth->take(), kLoggedIn + "RETR 1\r\nDELE 1\r\nQUIT\r\n");
  EXPECT_EQ(read_file(state_file), header + "u9\n");
  EXPECT_EQ(queued().size(), 5u);
}

TEST_F(PopClientTest, RefusalsAndStrayRepliesEndTheConnection) {
  auto link = connect();
  link->feed("+OK\r\n+OK\r\n-ERR wrong password\r\n");
  EXPECT_EQ(link->take(), "USER acct\r\nPASS secret\r\nQUIT\r\n");
  EXPECT_TRUE(link->closed());
  auto second = connect();
  second->feed("-ERR go away\r\n");
  EXPECT_TRUE(second->closed());
  // A reply to nothing: the connection ends, the message already in stays
  // queued, and nothing is deleted.
  auto third = connect();
  third->feed(login(false, 1));
  third->take();
  third->feed("+OK\r\nSubject: 1\r\n\r\n.\r\n+OK stray\r\n");
  EXPECT_TRUE(third->closed());
  EXPECT_EQ(third->take(), "");
  EXPECT_EQ(queued().size(), 1u);
}

// A TLS account logs in only once TLS (checked for the account's host) has
// started: from the first byte, or after STLS; a refusal or a failed
// handshake ends the connection with no password sent.
TEST_F(PopClientTest, TlsAccountsLogInOnlyUnderVerifiedTls) {
  for (PopTls tls : {PopTls::implicit, PopTls::stls}) {
    TestLink link(pop_client_session(PopAccount{"acct", "secret", "pop.isp.example", 995, false, tls}));
    ASSERT_EQ(link.tls_plan().has_value(), tls == PopTls::implicit);
    link.feed("+OK ready\r\n");
    if (tls == PopTls::stls) {
      EXPECT_EQ(link.take(), "STLS\r\n");
      link.feed("+OK begin\r\n+OK stray\r\n");
    }
    EXPECT_EQ(link.take(), "USER acct\r\n");
    EXPECT_TRUE(link.connection().secure());
    EXPECT_EQ(link.tls_plan()->host, "pop.isp.example");
    EXPECT_EQ(link.tls_plan()->verify, TlsVerify::peer);
    link.feed("+OK\r\n");
    EXPECT_EQ(link.take(), "PASS secret\r\n");
  }
  TestLink refused(pop_client_session(PopAccount{"acct", "secret", "h", 110, false, PopTls::stls}));
  refused.feed("+OK ready\r\n-ERR no TLS here\r\n");
  EXPECT_EQ(refused.output(), "STLS\r\nQUIT\r\n");
  TestLink broken(pop_client_session(PopAccount{"acct", "secret", "h", 110, false, PopTls::stls}));
  broken.refuse_tls();
  broken.feed("+OK ready\r\n+OK begin\r\n");
  EXPECT_EQ(broken.reason(), CloseReason::tls_failed);
  EXPECT_EQ(broken.output(), "STLS\r\n");
}

TEST_F(PopClientTest, ARunConnectsEachAccountOnceWhileTheLinkIsUp) {
  LoopbackPeer server;
  config.pop_hosts = "a:x@127.0.0.1:" + std::to_string(server.port) + ",-b:y@127.0.0.1:" + std::to_string(server.port);
  EXPECT_FALSE(hooks.popkick());  // the link is down
  link_up = 1;
  EXPECT_TRUE(hooks.popkick());
  EXPECT_EQ(hooks.pop_client_count(), 2);
  EXPECT_NE(status_bits & status::pop_client_running, 0u);
  EXPECT_EQ(pop_fetch_run(), 0);  // both still fetching
  {
    // Another session of the same account ending (an old one that goes
    // after a new run began) does not free the account.
    TestLink old(pop_client_session(PopAccount{"a", "x", "127.0.0.1", server.port, false}));
    old.finish();
  }
  EXPECT_EQ(pop_fetch_run(), 0);
  net_close_all();
  EXPECT_EQ(status_bits & status::pop_client_running, 0u);
  EXPECT_NE(status_bits & status::pop_client_ended, 0u);
  config.pop_hosts = "";
  EXPECT_FALSE(hooks.popkick());  // nothing to fetch: a transfer need not wait
}

TEST_F(PopClientTest, TheMailPollFetchesEveryPopTimeMinutes) {
  LoopbackPeer server;
  config.pop_hosts = "a:x@127.0.0.1:" + std::to_string(server.port);
  link_up = 1;
  ++server_now;
  pop_client_poll();  // pop.time 0: never by time
  EXPECT_EQ(hooks.pop_client_count(), 0);
  config.pop_time = 5;
  pop_client_poll();
  EXPECT_EQ(hooks.pop_client_count(), 1);
  net_close_all();
  server_now += 300;
  pop_client_poll();  // not yet due
  EXPECT_EQ(hooks.pop_client_count(), 0);
  ++server_now;
  pop_client_poll();
  EXPECT_EQ(hooks.pop_client_count(), 1);
  net_close_all();
}

}  // namespace
}  // namespace velmor
