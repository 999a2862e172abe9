// The IMAP session through the test driver (no sockets): a user with real
// mailboxes in a scratch home, the registered service, a clock the test moves.
#include "mail/imap_server.h"

#include <arpa/inet.h>

#include <filesystem>

#include "core/background.h"
#include "core/log.h"
#include "core/network.h"
#include "core/test_link.h"
#include "core/tls.h"
#include "core/util.h"
#include "mail/imap_check.h"
#include "mail/imap_subscriptions.h"
#include "mail/mailbox.h"
#include "mail/pop_server.h"
#include "mail/queue_test_fixture.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {
namespace {

constexpr const char* kSecretHash = "$1$7d1ZKX5F$d2aGUoNjVu30rj26rho90/";  // "secret"

std::string message(int n, std::string_view body, std::string_view extra = {}) {
  return mailbox_separator("MAIL FROM:<bob@far.example>", 1700000000 + n * 86400) +
         "From: bob@far.example\r\nSubject: m" + std::to_string(n) + "\r\n" + std::string(extra) +
         "X-UID: " + std::to_string(n) + "\r\n\r\n" + std::string(body) + ".\r\n";
}

class ImapSessionTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    home = root + "/alice";
    std::filesystem::create_directories(home + "/mail");
    write_file(root + "/users", "alice," + std::string(kSecretHash) + ",Alice Liddell," + home + ",0\n");
    write_file(root + "/groups", "#0\n%mail.pop.fetch: yes\n%mail.imap.fetch: yes\n%mail.msg.size: 100\n");
    ASSERT_EQ(user_load(root + "/users"), 0);
    ASSERT_EQ(groups_load(root + "/groups"), 0);
    mailbox_cache_clear();
    imap_register();
    pop_register();
  }
  void TearDown() override {
    mailbox_cache_clear();
    QueueFixture::TearDown();
  }
  void inbox(const std::vector<std::string>& messages) {
    std::string text;
    for (const auto& m : messages) text += m;
    write_file(home + "/mail/inbox", text);
  }
  std::unique_ptr<TestLink> login(std::string_view select = "SELECT INBOX") {
    auto link = std::make_unique<TestLink>(svc::imap);
    EXPECT_TRUE(link->take().starts_with("* OK "));
    EXPECT_EQ(say(*link, "l LOGIN alice secret\r\n"), "l OK LOGIN completed\r\n");
    if (!select.empty()) {
      EXPECT_NE(say(*link, "s " + std::string(select) + "\r\n").find("s OK ["), std::string::npos);
    }
    return link;
  }
  static std::string say(TestLink& link, std::string_view text, std::size_t piece = 0) {
    link.feed(text, piece);
    return link.take();
  }
  std::string home;
};

TEST_F(ImapSessionTest, CommandsAreReadWholeAnsweredInTurnAndGuardedBeforeLogin) {
  inbox({message(1, "one\r\n")});
  TestLink link(svc::imap);
  link.take();
  // Before LOGIN only CAPABILITY, NOOP, LOGOUT and LOGIN run; pipelined
  // commands are each answered, in order.
  EXPECT_EQ(say(link, "a CAPABILITY\r\nb SELECT INBOX\r\nc DELETE etc/passwd\r\nd NOOP\r\ne uid\r\nf FOO\r\n"),
            "* CAPABILITY IMAP4rev1 IDLE UIDPLUS MOVE NAMESPACE SPECIAL-USE\r\na OK CAPABILITY completed\r\n"
            "b BAD Not in correct auth state\r\nc BAD Not in correct auth state\r\nd OK NOOP completed\r\n"
            "e BAD Unknown command\r\nf BAD Unknown command `FOO'\r\n");
  // A password with '"' and '\' quoted, then as literals a byte at a time.
  write_file(root + "/users", "alice," + md5_crypt("p\"w\\d", "$1$abcde$") + ",A," + home + ",0\n");
  ASSERT_EQ(user_load(root + "/users"), 0);
  EXPECT_EQ(say(link, "g LOGIN alice \"p\\\"w\\\\d\"\r\n"), "g OK LOGIN completed\r\n");
  TestLink other(svc::imap);
  other.take();
  EXPECT_EQ(say(other, "h LOGIN {5}\r\nalice {5}\r\np\"w\\d\r\n", 1),
            "+ Ready for literal data\r\n+ Ready for literal data\r\nh OK LOGIN completed\r\n");
  // An over-long line gets its own tagged BAD; the next command is served.
  EXPECT_EQ(say(other, "i NOOP " + std::string(20000, 'x') + "\r\nj NOOP\r\n"),
            "i BAD command line too long\r\nj OK NOOP completed\r\n");
  // A tag is echoed without its control characters.
  EXPECT_EQ(say(other, "k\rl APPEND INBOX {x}\r\n"), "k?l BAD Invalid size argument\r\n");
  // A wrong password is answered a second late; what follows waits its turn.
  TestLink third(svc::imap);
  third.take();
  EXPECT_EQ(say(third, "k LOGIN alice wrong\r\nm NOOP\r\n"), "");
  third.advance(std::chrono::seconds(1));
  EXPECT_EQ(third.take(), "k NO Bad LOGIN user name/password\r\nm OK NOOP completed\r\n");
}

TEST_F(ImapSessionTest, NamesStayInTheHome) {
  auto link = login("");
  for (const char* name :
       {"../x", "/etc/passwd", "~root/x", "mail/.forward", ".forward", "mail//x", "mail/overview/inbox", "mail/inbox~",
        "a\x01"
        "b",
        "mail/../../x"}) {
    std::string quoted = "\"" + std::string(name) + "\"";
    EXPECT_EQ(say(*link, "a SELECT " + quoted + "\r\n"), "a NO Invalid mailbox name\r\n") << name;
    EXPECT_EQ(say(*link, "b CREATE " + quoted + "\r\n"), "b NO Invalid mailbox name\r\n") << name;
    EXPECT_EQ(say(*link, "c DELETE " + quoted + "\r\n"), "c NO Invalid mailbox name\r\n") << name;
    EXPECT_EQ(say(*link, "d LIST \"\" " + quoted + "\r\n"), "d NO Invalid mailbox name\r\n") << name;
  }
  EXPECT_EQ(say(*link, "e LIST \"~\" \"*\"\r\n"), "e NO Invalid mailbox name\r\n");
  // LIST gives what SELECT takes: the inbox as INBOX, folders, no overview,
  // dot files or "~" files; "%" stops at "/".
  write_file(home + "/.forward", "x\n");
  write_file(home + "/mail/inbox~", "");
  EXPECT_EQ(say(*link, "f CREATE mail/work\r\ng CREATE mail/work\r\nh CREATE INBOX\r\n"),
            "f OK create completed\r\ng NO create failed: mailbox already exists\r\nh NO can't create INBOX\r\n");
  EXPECT_EQ(say(*link, "i LIST \"\" *\r\n"),
            "* LIST () \"/\" \"INBOX\"\r\n* LIST (\\Noselect) \"/\" \"mail\"\r\n* LIST () \"/\" \"mail/work\"\r\n"
            "i OK LIST completed\r\n");
  EXPECT_EQ(say(*link, "j LIST \"\" %\r\n"),
            "* LIST () \"/\" \"INBOX\"\r\n* LIST (\\Noselect) \"/\" \"mail\"\r\nj OK LIST completed\r\n");
  // RENAME takes the overview along, refuses an existing target; DELETE of a
  // missing box is NO.
  EXPECT_TRUE(say(*link, "k STATUS mail/work (UIDVALIDITY)\r\n").starts_with("* STATUS \"mail/work\" (UIDVALIDITY "));
  EXPECT_EQ(say(*link, "l CREATE mail/play\r\nm RENAME mail/work mail/play\r\nn RENAME mail/work mail/done\r\n"),
            "l OK create completed\r\nm NO rename failed: mailbox already exists\r\nn OK rename completed\r\n");
  EXPECT_TRUE(std::filesystem::exists(home + "/mail/overview/done"));
  EXPECT_FALSE(std::filesystem::exists(home + "/mail/overview/work"));
  EXPECT_EQ(say(*link, "o DELETE mail/work\r\np DELETE mail/done\r\n"),
            "o NO delete failed: no such mailbox\r\np OK delete completed\r\n");
  EXPECT_FALSE(std::filesystem::exists(home + "/mail/overview/done"));
  // Subscriptions live with the connection; FIND lists the mailboxes alone.
  EXPECT_EQ(say(*link,
                "q SUBSCRIBE mail/play\r\nr LSUB \"\" *\r\ns UNSUBSCRIBE mail/play\r\nt UNSUBSCRIBE mail/play\r\n"
                "u FIND ALL.MAILBOXES mail/*\r\nv STATUS mail/play (MESSAGES UIDNEXT)\r\n"),
            "q OK SUBSCRIBE mail/play completed\r\n* LSUB () \"/\" \"mail/play\"\r\nr OK LSUB completed\r\n"
            "s OK UNSUBSCRIBE mail/play completed\r\nt NO Mailbox not in subscribe list\r\n"
            "* MAILBOX \"mail/play\"\r\nu OK FIND ALL.MAILBOXES * completed\r\n"
            "* STATUS \"mail/play\" (MESSAGES 0 UIDNEXT 1)\r\nv OK Status completed\r\n");
}

TEST_F(ImapSessionTest, FetchStoreAndSequenceSetsCostWhatTheyMatch) {
  inbox({message(1, "one\r\n..dot\r\n"), message(2, "two\r\n"), message(3, "three\r\n"), message(4, "four\r\n")});
  auto link = login();
  // A number past the end is BAD with nothing done; "*" is the last one.
  EXPECT_EQ(say(*link, "a STORE 2:9 +FLAGS (\\Deleted)\r\n"), "a BAD Invalid message set\r\n");
  EXPECT_EQ(say(*link, "b STORE 3:* +FLAGS.SILENT (\\Deleted \\Flagged)\r\nc FETCH 1:* (FLAGS)\r\n"),
            "b OK STORE completed\r\n* 1 FETCH (FLAGS ())\r\n* 2 FETCH (FLAGS ())\r\n"
            "* 3 FETCH (FLAGS (\\Flagged \\Deleted))\r\n* 4 FETCH (FLAGS (\\Flagged \\Deleted))\r\n"
            "c OK FETCH completed\r\n");
  // UID ranges are clamped, absent UIDs skipped.
  EXPECT_TRUE(say(*link, "d UID FETCH 2:4294967295 (FLAGS)\r\n").starts_with("* 2 FETCH (FLAGS () UID 2)"));
  EXPECT_EQ(say(*link, "e UID STORE 1,3,99 FLAGS (\\Answered \\Draft \\Seen foo)\r\n"),
            "* 1 FETCH (UID 1 FLAGS (\\Seen \\Answered \\Draft))\r\n"
            "* 3 FETCH (UID 3 FLAGS (\\Seen \\Answered \\Draft))\r\ne OK STORE completed\r\n");
  // BODY[] is the message as sent, and sets \Seen.
  std::string out = say(*link, "f FETCH 2 BODY[]\r\n");
  std::string stored2 = message(2, "two\r\n");
  std::string plain2 = stored2.substr(stored2.find("\r\n") + 2, stored2.size() - stored2.find("\r\n") - 2 - 3);
  std::vector<std::pair<std::string, imap_check::Value>> items;
  std::uint32_t seq = 0;
  ASSERT_EQ(imap_check::Reader(out.substr(0, out.find("f OK"))).fetch(seq, items), "") << out;
  EXPECT_EQ(imap_check::find(items, "BODY[]")->text, plain2);
  EXPECT_NE(out.find("FLAGS (\\Seen)"), std::string::npos) << out;
  EXPECT_EQ(say(*link, "g FETCH 1 BODY[TEXT]\r\n"),
            "* 1 FETCH (BODY[TEXT] {11}\r\none\r\n.dot\r\n UID 1)\r\ng OK FETCH completed\r\n");
  // A partial past the end is empty.
  EXPECT_EQ(say(*link, "h FETCH 2 BODY.PEEK[]<1000.10>\r\n"),
            "* 2 FETCH (BODY[]<1000> {0}\r\n UID 2)\r\nh OK FETCH completed\r\n");
  // The flags reach the overview by the connection's end at the latest.
  link->finish();
  std::string overview = read_file(home + "/mail/overview/inbox");
  EXPECT_NE(overview.find("#flags 3 "), std::string::npos);
  mailbox_cache_clear();
  Mailbox* box = mailbox_lookup(home + "/mail/inbox");
  ASSERT_TRUE(box);
  auto it = box->messages.begin();
  EXPECT_EQ(it->flags & 0xc38u, msgflag::seen | msgflag::answered | msgflag::draft);
  ++it;
  EXPECT_TRUE(it->flags & msgflag::seen);
  ++it;
  ++it;
  EXPECT_EQ(it->flags & 0xc38u, msgflag::deleted | msgflag::flagged);
}

TEST_F(ImapSessionTest, ExamineIsReadOnly) {
  inbox({message(1, "one\r\n")});
  auto link = login("EXAMINE INBOX");
  EXPECT_EQ(say(*link, "a STORE 1 +FLAGS (\\Deleted)\r\nb EXPUNGE\r\n"),
            "a NO STORE failure: mailbox is read-only\r\nb NO Expunge failure: mailbox is read-only\r\n");
  EXPECT_EQ(say(*link, "c FETCH 1 (BODY[] FLAGS)\r\n").find("Seen"), std::string::npos);
  link->finish();
  mailbox_cache_clear();
  EXPECT_FALSE(mailbox_lookup(home + "/mail/inbox")->messages.front().flags & msgflag::seen);
}

TEST_F(ImapSessionTest, SessionsShareABoxEachInItsOwnViewAndWithPop3) {
  inbox({message(1, "one\r\n"), message(2, "two\r\n"), message(3, "three\r\n")});
  auto a = login();
  auto b = login();
  // A POP3 session comes in beside them, with the messages present now.
  TestLink pop(svc::pop);
  pop.take();
  EXPECT_TRUE(say(pop, "USER alice\r\nPASS secret\r\n").ends_with("+OK 3 messages waiting for alice\r\n"));
  // a deletes message 2; b, in the middle of its work, keeps its numbers:
  // no EXPUNGE during FETCH, STORE or SEARCH; it comes at the next NOOP.
  EXPECT_EQ(say(*a, "a1 STORE 2 +FLAGS.SILENT (\\Deleted)\r\na2 EXPUNGE\r\n"),
            "a1 OK STORE completed\r\n* 2 EXPUNGE\r\n* 2 EXISTS\r\na2 OK EXPUNGE completed\r\n");
  EXPECT_EQ(say(*b, "b1 FETCH 3 (UID FLAGS)\r\nb2 SEARCH ALL\r\n"),
            "* 3 FETCH (UID 3 FLAGS ())\r\nb1 OK FETCH completed\r\n* SEARCH 1 3\r\nb2 OK SEARCH completed\r\n");
  EXPECT_EQ(say(*b, "b3 FETCH 2 (FLAGS)\r\n"), "b3 NO Some of the requested messages no longer exist\r\n");
  // A COPY that names it copies nothing.
  EXPECT_EQ(say(*b, "b3 CREATE saved\r\nb3 COPY 1:3 saved\r\n"),
            "b3 OK create completed\r\nb3 NO Some of the requested messages no longer exist\r\n");
  EXPECT_EQ(read_file(home + "/saved"), "");
  EXPECT_EQ(say(*b, "b4 NOOP\r\n"), "* 2 EXPUNGE\r\nb4 OK NOOP completed\r\n");
  // New mail shows at the next command.
  write_file(home + "/mail/inbox", read_file(home + "/mail/inbox") + message(9, "nine\r\n"));
  mailbox_lookup(home + "/mail/inbox");
  EXPECT_EQ(say(*b, "b5 NOOP\r\n"), "* 3 EXISTS\r\n* 1 RECENT\r\nb5 OK NOOP completed\r\n");
  // POP3 keeps its three (the expunged one read from the file it holds,
  // the new one left for its next session); a second POP3 session waits.
  std::string held = say(pop, "UIDL\r\nTOP 2 0\r\n");
  EXPECT_TRUE(held.starts_with("+OK\r\n1 1\r\n2 2\r\n3 3\r\n.\r\n+OK ")) << held;
  EXPECT_NE(held.find("Subject: m2\r\n"), std::string::npos) << held;
  TestLink pop2(svc::pop);
  pop2.take();
  EXPECT_EQ(say(pop2, "USER alice\r\nPASS secret\r\n").substr(30, 13), "-ERR [IN-USE]");
  // Its deletions apply at QUIT, by identifier, and the IMAP sessions hear them.
  EXPECT_TRUE(say(pop, "DELE 1\r\nDELE 2\r\nQUIT\r\n").ends_with("shutdown (2 messages left)\r\n"));
  EXPECT_EQ(say(*b, "b6 NOOP\r\n"), "* 1 EXPUNGE\r\nb6 OK NOOP completed\r\n");
  EXPECT_TRUE(say(*a, "a3 NOOP\r\n").starts_with("* 1 EXPUNGE\r\n* 2 EXISTS\r\n"));
}

TEST_F(ImapSessionTest, AppendAndCopyStoreWholeMessagesOrNothing) {
  inbox({message(1, "one\r\n")});
  auto link = login();
  const std::string body = "Subject: hi\r\nStatus: RO\r\nX-UID: 77\r\n\r\n.dot\r\nlast";
  // Sizes: digits, within the group's limit (100 KB here), not empty.
  EXPECT_EQ(say(*link, "a APPEND INBOX {0}\r\n"), "a BAD Invalid size argument\r\n");
  EXPECT_EQ(say(*link, "b APPEND INBOX {-1}\r\n"), "b BAD Invalid size argument\r\n");
  EXPECT_EQ(say(*link, "c APPEND INBOX {99999999999}\r\n"), "c NO [TOOBIG] message larger than 102400 bytes\r\n");
  EXPECT_EQ(say(*link, "d APPEND nowhere {5}\r\nhello\r\n"), "d NO [TRYCREATE] Mailbox does not exist\r\n");
  const std::string before = read_file(home + "/mail/inbox");
  // A client gone in the middle of its literal leaves the mailbox as it was.
  {
    TestLink gone(svc::imap);
    gone.take();
    say(gone, "l LOGIN alice secret\r\nx APPEND INBOX {100}\r\nSubject: half\r\n");
    gone.vanish();
  }
  EXPECT_EQ(read_file(home + "/mail/inbox"), before);
  // Sent a byte at a time: stored as delivery stores, with the next UID and
  // the flags asked for.
  std::string cmd =
      "e APPEND INBOX (\\Seen \\Flagged) \"01-Feb-2026 10:00:00 +0000\" {" + std::to_string(body.size()) + "}\r\n";
  const std::uint32_t validity = mailbox_lookup(home + "/mail/inbox")->uid_validity;
  EXPECT_EQ(say(*link, cmd + body + "\r\n", 1),
            "+ Ready for message body\r\n* 2 EXISTS\r\n* 1 RECENT\r\ne OK [APPENDUID " + std::to_string(validity) +
                " 2] APPEND completed\r\n");
  std::string box = read_file(home + "/mail/inbox");
  EXPECT_EQ(box.substr(before.size()).find("Status: RO"), std::string::npos);
  EXPECT_NE(box.find("\r\nSubject: hi\r\nStatus:     R\r\nX-Status:      \r\nX-UID: 2\r\n\r\n..dot\r\nlast\r\n.\r\n"),
            std::string::npos);
  EXPECT_EQ(say(*link, "f FETCH 2 (FLAGS BODY.PEEK[TEXT])\r\n"),
            "* 2 FETCH (FLAGS (\\Seen \\Flagged \\Recent) BODY[TEXT] {12}\r\n.dot\r\nlast\r\n UID 2)\r\n"
            "f OK FETCH completed\r\n");
  EXPECT_EQ(mailbox_lookup(home + "/mail/inbox")->messages.back().internal_date, 1769940000);  // 1 Feb 2026 10:00 UTC
  // COPY gives the target's next UIDs and carries the flags.
  EXPECT_EQ(say(*link, "g COPY 1:2 nowhere\r\nh CREATE work\r\n"),
            "g NO [TRYCREATE] Invalid mailbox: can't copy messages\r\nh OK create completed\r\n");
  const std::string work_validity = std::to_string(mailbox_lookup(home + "/work", home)->uid_validity);
  EXPECT_EQ(say(*link, "i COPY 2,1 work\r\n"), "i OK [COPYUID " + work_validity + " 1:2 1:2] COPY completed\r\n");
  std::string work = read_file(home + "/work");
  EXPECT_NE(work.find("X-UID: 1\r\n\r\none"), std::string::npos);
  EXPECT_NE(work.find("X-UID: 2\r\n\r\n..dot"), std::string::npos);
  Mailbox* target = mailbox_lookup(home + "/work", home);
  ASSERT_EQ(target->messages.size(), 2u);
  EXPECT_EQ(target->messages.back().flags & (msgflag::seen | msgflag::flagged), msgflag::seen | msgflag::flagged);
  // A failed write of the copies leaves the target as it was.
  sysio::fail_nth(sysio::Op::write, 2);
  EXPECT_EQ(say(*link, "j COPY 1:2 work\r\n").substr(0, 18), "j NO COPY failed: ");
  EXPECT_EQ(read_file(home + "/work"), work);
}

TEST_F(ImapSessionTest, SearchAnswersTruly) {
  inbox({message(1, "apple\r\n", "Cc: carol@far.example\r\n"), message(2, "pear\r\n"), message(80, "plum\r\n")});
  auto link = login();
  std::string since = say(*link, "a SEARCH SINCE 1-Jan-2024\r\n");
  EXPECT_EQ(since, "* SEARCH 3\r\na OK SEARCH completed\r\n");
  EXPECT_EQ(say(*link, "b SEARCH OR BODY apple CC carol NOT SUBJECT m80\r\n"),
            "* SEARCH 1\r\nb OK SEARCH completed\r\n");
  EXPECT_EQ(say(*link, "c UID SEARCH TEXT plum\r\n"), "* SEARCH 80\r\nc OK SEARCH completed\r\n");
  EXPECT_EQ(say(*link, "d SEARCH BEFORE 1-Jan-2024 (SUBJECT m1 UID 1:*)\r\n"),
            "* SEARCH 1\r\nd OK SEARCH completed\r\n");
  EXPECT_EQ(say(*link, "e SEARCH SINCE Feb-2026\r\n"), "e BAD SEARCH arguments invalid\r\n");
  // A command holds at most 256 keys, nested at most 32 deep;
  // two charsets are known.
  std::string keys;
  for (int i = 0; i < 256; ++i) keys += " 1";
  auto nested = [](int depth) { return std::string(depth, '(') + "ALL" + std::string(depth, ')'); };
  const std::string limit = "f NO [LIMIT] SEARCH takes at most 256 keys, nested at most 32 deep\r\n";
  const std::string all = "* SEARCH 1 2 3\r\nf OK SEARCH completed\r\n";
  const struct {
    std::string command, reply;
  } kLimits[] = {
      {"SEARCH" + keys, "* SEARCH 1\r\nf OK SEARCH completed\r\n"},
      {"SEARCH" + keys + " ALL", limit},
      {"SEARCH " + nested(32), all},
      {"SEARCH " + nested(33), limit},
      {"SEARCH CHARSET UTF-8 SUBJECT m2", "* SEARCH 2\r\nf OK SEARCH completed\r\n"},
      {"SEARCH CHARSET KOI8-R ALL", "f NO [BADCHARSET (US-ASCII UTF-8)] unknown charset\r\n"},
  };
  for (const auto& row : kLimits)
    EXPECT_EQ(say(*link, "f " + row.command + "\r\n"), row.reply) << row.command.substr(0, 40);
}

// A SEARCH that reads message text runs a slice at a time in the
// background: the session answers when it is done, its next command waits,
// other sessions are served meanwhile, and a message another session
// expunges in between is simply not found.
TEST_F(ImapSessionTest, ABodySearchRunsInSlicesWhileOthersAreServed) {
  std::vector<std::string> box;
  for (int n = 1; n <= 24; ++n) box.push_back(message(n, std::string(100000, 'x') + (n % 5 ? "\r\n" : " Needle\r\n")));
  inbox(box);
  auto a = login();
  auto b = login();
  EXPECT_EQ(say(*a, "a1 SEARCH BODY nEEDLE\r\na2 NOOP\r\n"), "");
  EXPECT_EQ(background_count(), 1u);
  EXPECT_EQ(say(*b, "b1 NOOP\r\nb2 STORE 5 +FLAGS.SILENT (\\Deleted)\r\nb3 EXPUNGE\r\n"),
            "b1 OK NOOP completed\r\nb2 OK STORE completed\r\n* 5 EXPUNGE\r\n* 23 EXISTS\r\nb3 OK EXPUNGE completed\r\n");
  int rounds = 1;
  while (background_round()) ++rounds;
  EXPECT_GE(rounds, 4);
  a->turn();
  EXPECT_EQ(a->take(), "* SEARCH 10 15 20\r\na1 OK SEARCH completed\r\n* 5 EXPUNGE\r\na2 OK NOOP completed\r\n");
  // A client gone in the middle of its search takes the work with it.
  EXPECT_EQ(say(*b, "b4 UID SEARCH TEXT needle\r\n"), "");
  b->vanish();
  EXPECT_EQ(background_count(), 0u);
}

// A client pipelining a thousand SUBSCRIBEs gets sixteen answered per pass
// of the loop, while others are served; each one appends a line to the
// subscriptions file, which nothing rewrites until the lines that take
// names out outnumber the names.
TEST_F(ImapSessionTest, PipelinedCommandsTakeTurnsAndSubscriptionsAreAppended) {
  auto a = login("");
  auto b = login("");
  a->hold_passes();
  std::string subscribe, unsubscribe, names;
  for (int i = 0; i < 1000; ++i) {
    subscribe += "s" + std::to_string(i) + " SUBSCRIBE box" + std::to_string(i) + "\r\n";
    if (i < 400) unsubscribe += "u" + std::to_string(i) + " UNSUBSCRIBE box" + std::to_string(i) + "\r\n";
    names += "box" + std::to_string(i) + "\n";
  }
  sysio::reset();
  a->feed(subscribe);
  auto answered = [](const std::string& out) { return std::count(out.begin(), out.end(), '\n'); };
  EXPECT_EQ(answered(a->take()), 16);
  EXPECT_EQ(say(*b, "n NOOP\r\n"), "n OK NOOP completed\r\n");
  int passes = 0;
  while (a->pass()) ++passes;
  EXPECT_EQ(passes, 62);
  std::string rest = a->take();
  EXPECT_EQ(answered(rest), 984);
  EXPECT_TRUE(rest.ends_with("s999 OK SUBSCRIBE box999 completed\r\n"));
  EXPECT_EQ(read_file(home + "/mail/.subscriptions"), names);
  EXPECT_EQ(sysio::count(sysio::Op::rename) + sysio::count(sysio::Op::sync), 0u);
  // Taking names out appends too, until the file is compacted once.
  a->feed(unsubscribe);
  while (a->pass()) {
  }
  EXPECT_EQ(answered(a->take()), 400);
  EXPECT_EQ(sysio::count(sysio::Op::rename), 1u);
  std::string file = read_file(home + "/mail/.subscriptions");
  EXPECT_LT(file.size(), names.size());
  EXPECT_EQ(imap_subscriptions_text(imap_subscriptions_parse(file)), names.substr(names.find("box400")));
  EXPECT_EQ(say(*b, "l LSUB \"\" box99*\r\n"),
            "* LSUB () \"/\" \"box990\"\r\n* LSUB () \"/\" \"box991\"\r\n* LSUB () \"/\" \"box992\"\r\n"
            "* LSUB () \"/\" \"box993\"\r\n* LSUB () \"/\" \"box994\"\r\n* LSUB () \"/\" \"box995\"\r\n"
            "* LSUB () \"/\" \"box996\"\r\n* LSUB () \"/\" \"box997\"\r\n* LSUB () \"/\" \"box998\"\r\n"
            "* LSUB () \"/\" \"box999\"\r\nl OK LSUB completed\r\n");
  EXPECT_EQ(say(*b, "m UNSUBSCRIBE box0\r\n"), "m NO Mailbox not in subscribe list\r\n");
}

TEST_F(ImapSessionTest, UidValidityIsKeptAndNewOnlyForALostOverviewAndFlagsOutliveARebuild) {
  inbox({message(1, "one\r\n")});
  Mailbox* box = mailbox_lookup(home + "/mail/inbox");
  ASSERT_TRUE(box);
  std::uint32_t validity = box->uid_validity;
  EXPECT_NE(validity, 0u);
  box->messages.front().flags |= msgflag::flagged | msgflag::draft;
  mailbox_flags_changed(*box, box->messages.front());
  ASSERT_EQ(mailbox_overview_flush(*box), 0);
  mailbox_cache_clear();  // a restart
  write_file(home + "/mail/inbox", read_file(home + "/mail/inbox") + message(2, "two\r\n"));
  EXPECT_EQ(mailbox_lookup(home + "/mail/inbox")->uid_validity, validity);
  // A mailbox changed behind the overview's back is parsed again: the
  // messages keep their identifiers, flags and validity.
  mailbox_cache_clear();
  std::filesystem::last_write_time(home + "/mail/inbox",
                                   std::filesystem::file_time_type::clock::now() + std::chrono::hours(1));
  box = mailbox_lookup(home + "/mail/inbox");
  EXPECT_EQ(box->uid_validity, validity);
  EXPECT_EQ(box->messages.front().flags & (msgflag::flagged | msgflag::draft), msgflag::flagged | msgflag::draft);
  mailbox_cache_clear();
  std::filesystem::remove(home + "/mail/overview/inbox");
  EXPECT_NE(mailbox_lookup(home + "/mail/inbox")->uid_validity, validity);
}

TEST_F(ImapSessionTest, IdleHearsOtherSessionsAndDeliveryAtOnceAndEndsWithDone) {
  inbox({message(1, "one\r\n"), message(2, "two\r\n")});
  auto b = login();
  auto a = login();
  EXPECT_EQ(say(*a, "n NAMESPACE\r\n"), "* NAMESPACE ((\"\" \"/\")) NIL NIL\r\nn OK NAMESPACE completed\r\n");
  EXPECT_EQ(say(*a, "i IDLE\r\n"), "+ idling\r\n");
  EXPECT_EQ(a->connection().idle_timeout(), 1740);  // not the command time-out
  // Another session's STORE and EXPUNGE, and new mail, reach the idle
  // client as they happen, with no command from it.
  say(*b, "b1 STORE 1 +FLAGS.SILENT (\\Flagged)\r\n");
  a->advance(std::chrono::milliseconds(1));
  EXPECT_EQ(a->take(), "* 1 FETCH (UID 1 FLAGS (\\Flagged))\r\n");
  say(*b, "b2 STORE 2 +FLAGS.SILENT (\\Deleted)\r\nb3 EXPUNGE\r\n");
  a->advance(std::chrono::milliseconds(1));
  EXPECT_EQ(a->take(), "* 2 EXPUNGE\r\n");
  write_file(home + "/mail/inbox", read_file(home + "/mail/inbox") + message(9, "nine\r\n"));
  mailbox_lookup(home + "/mail/inbox");
  a->advance(std::chrono::milliseconds(1));
  EXPECT_EQ(a->take(), "* 2 EXISTS\r\n* 1 RECENT\r\n");
  EXPECT_EQ(say(*a, "DONE\r\nx NOOP\r\n"), "i OK IDLE terminated\r\nx OK NOOP completed\r\n");
  EXPECT_EQ(a->connection().idle_timeout(), 120);
  EXPECT_EQ(say(*a, "j IDLE\r\nnonsense\r\n"), "+ idling\r\nj BAD IDLE ended without DONE\r\n");
}

TEST_F(ImapSessionTest, UidExpungeAndMoveRemoveOnlyTheirOwnMessages) {
  inbox({message(1, "one\r\n"), message(2, "two\r\n"), message(3, "three\r\n"), message(4, "four\r\n")});
  auto link = login();
  // 1 and 3 are deleted; UID EXPUNGE 2:4 takes 3 only (2 and 4 are not deleted).
  EXPECT_EQ(say(*link, "a STORE 1,3 +FLAGS.SILENT (\\Deleted)\r\nb UID EXPUNGE 2:4\r\n"),
            "a OK STORE completed\r\n* 3 EXPUNGE\r\n* 3 EXISTS\r\nb OK EXPUNGE completed\r\n");
  EXPECT_EQ(say(*link, "c UID EXPUNGE 7\r\nd UID EXPUNGE x\r\n"),
            "* 3 EXISTS\r\nc OK EXPUNGE completed\r\nd BAD Invalid message set\r\n");
  // MOVE copies, then expunges just the moved messages: 1 stays deleted.
  say(*link, "e CREATE Trash\r\n");
  const std::string validity = std::to_string(mailbox_lookup(home + "/Trash", home)->uid_validity);
  EXPECT_EQ(say(*link, "f UID MOVE 4,2 Trash\r\n"),
            "* OK [COPYUID " + validity + " 2,4 1:2] Moved\r\n* 2 EXPUNGE\r\n* 2 EXPUNGE\r\nf OK MOVE completed\r\n");
  EXPECT_EQ(say(*link, "g UID FETCH 1:* (FLAGS)\r\n"),
            "* 1 FETCH (FLAGS (\\Deleted) UID 1)\r\ng OK FETCH completed\r\n");
  EXPECT_EQ(say(*link, "h MOVE 1 nowhere\r\n"), "h NO [TRYCREATE] Invalid mailbox: can't copy messages\r\n");
  Mailbox* trash = mailbox_lookup(home + "/Trash", home);
  ASSERT_EQ(trash->messages.size(), 2u);
  EXPECT_EQ(trash->messages.front().flags & msgflag::deleted, 0u);
  // Read-only: nothing moves.
  EXPECT_EQ(say(*link, "i EXAMINE INBOX\r\n").find("i OK [READ-ONLY]") != std::string::npos, true);
  EXPECT_EQ(say(*link, "j MOVE 1 Trash\r\n"), "j NO MOVE failed: mailbox is read-only\r\n");
}

TEST_F(ImapSessionTest, SubscriptionsAreKeptInTheHomeAndFollowRenameAndDelete) {
  auto link = login("");
  EXPECT_EQ(say(*link, "a SUBSCRIBE inbox\r\nb CREATE work\r\nc SUBSCRIBE work\r\nd CREATE Sent\r\n"),
            "a OK SUBSCRIBE INBOX completed\r\nb OK create completed\r\nc OK SUBSCRIBE work completed\r\n"
            "d OK create completed\r\n");
  EXPECT_EQ(say(*link, "e RENAME work play\r\n"), "e OK rename completed\r\n");
  EXPECT_EQ(read_file(home + "/mail/.subscriptions"), "INBOX\nplay\n");
  // Another session (or a restart) reads them from the file.
  auto other = login("");
  EXPECT_EQ(say(*other, "f LSUB \"\" *\r\n"),
            "* LSUB () \"/\" \"INBOX\"\r\n* LSUB () \"/\" \"play\"\r\nf OK LSUB completed\r\n");
  EXPECT_EQ(say(*other, "g DELETE play\r\nh LSUB \"\" *\r\n"),
            "g OK delete completed\r\n* LSUB () \"/\" \"INBOX\"\r\nh OK LSUB completed\r\n");
  EXPECT_EQ(say(*other, "i LIST \"\" %\r\n"),
            "* LIST () \"/\" \"INBOX\"\r\n* LIST (\\Sent) \"/\" \"Sent\"\r\n* LIST (\\Noselect) \"/\" \"mail\"\r\n"
            "i OK LIST completed\r\n");
  // A planted link is not followed.
  write_file(root + "/elsewhere", "secret\n");
  std::filesystem::remove(home + "/mail/.subscriptions");
  std::filesystem::create_symlink(root + "/elsewhere", home + "/mail/.subscriptions");
  EXPECT_EQ(say(*other, "j LSUB \"\" *\r\n"), "j OK LSUB completed\r\n");
}

}  // namespace
}  // namespace velmor

namespace velmor {
namespace {

// STARTTLS is offered and run only before login while a certificate is
// loaded, and not offered once encrypted; with tls.plain.login
// off a stranger sees LOGINDISABLED and LOGIN is refused unread and unlogged
// until the connection is encrypted.
TEST_F(ImapSessionTest, StartTlsBeforeLoginDropsPipelinedCommandsAndGuardsClearPasswords) {
  const std::string base = "* CAPABILITY IMAP4rev1 IDLE UIDPLUS MOVE NAMESPACE SPECIAL-USE";
  TestLink off(svc::imap);
  off.take();
  EXPECT_EQ(say(off, "a STARTTLS\r\n"), "a BAD TLS is not available on this server\r\n");

  config.tls_cert = root + "/cert.pem";
  config.tls_key = root + "/key.pem";
  ASSERT_EQ(tls_make_self_signed(root + "/cert.pem", root + "/key.pem", "mail.example.test"), "");
  ASSERT_EQ(tls_load(), TlsLoad::loaded);
  config.tls_plain_login = false;
  log_parse("2 " + root + "/main\n");
  log_mask = logfac::imap;
  TestLink link(svc::imap, Peer{inet_addr("192.0.2.9"), 4000, "192.0.2.9"});
  link.take();
  EXPECT_EQ(say(link, "a CAPABILITY\r\n"), base + " STARTTLS LOGINDISABLED\r\na OK CAPABILITY completed\r\n");
  EXPECT_EQ(say(link, "b LOGIN alice secret\r\n"),
            "b NO [PRIVACYREQUIRED] Use STARTTLS first: passwords are not accepted unencrypted from outside the "
            "local network\r\n");
  EXPECT_EQ(say(link, "c STARTTLS x\r\n"), "c BAD STARTTLS takes no arguments\r\n");
  EXPECT_EQ(say(link, "d STARTTLS\r\n"), "d OK Begin TLS negotiation now\r\n");
  EXPECT_TRUE(link.connection().secure());
  EXPECT_EQ(say(link, "f CAPABILITY\r\n"), base + "\r\nf OK CAPABILITY completed\r\n");
  EXPECT_EQ(say(link, "g STARTTLS\r\n"), "g BAD TLS is already active\r\n");
  EXPECT_EQ(say(link, "h LOGIN alice secret\r\ni STARTTLS\r\n"),
            "h OK LOGIN completed\r\ni BAD TLS is already active\r\n");
  log_flush_all();
  EXPECT_EQ(read_file(root + "/main").find("192.0.2.9"), std::string::npos);

  // From a private address the clear-text login stays; after login STARTTLS is not offered.
  TestLink local(svc::imap, Peer{inet_addr("10.0.0.7"), 4000, "10.0.0.7"});
  local.take();
  EXPECT_EQ(say(local, "a LOGIN alice secret\r\nb CAPABILITY\r\nc STARTTLS\r\n"),
            "a OK LOGIN completed\r\n" + base + "\r\nb OK CAPABILITY completed\r\nc BAD Not in correct auth state\r\n");
  log_parse("");
}

}  // namespace
}  // namespace velmor
