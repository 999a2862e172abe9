#include "mail/delivery.h"

#include <gtest/gtest.h>
#include <grp.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/util.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"
#include "mail/queue_test_fixture.h"
#include "core/test_files.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {
namespace {

namespace fs = std::filesystem;

using testing_files::read_file;
using testing_files::write_file;

QueueLayout layout_of(std::string_view text) {
  TextSource in(text);
  return queue_layout(in);
}

TEST(QueueFile, LayoutFindsEnvelopeDataAndHeader) {
  std::string q =
      "MAIL FROM:<bob@x>\r\nRCPT TO:<ann@y>\r\nrcpt to:<eve@y>\r\nDATA\r\nSubject: hi\r\n there\r\n"
      "Precedence: bulk\r\n\r\nbody\r\n.\r\n";
  QueueLayout l = layout_of(q);
  EXPECT_EQ(l.envelope, "MAIL FROM:<bob@x>");
  EXPECT_EQ(q.substr(l.data_line, 6), "DATA\r\n");
  EXPECT_EQ(q.substr(l.message, 8), "Subject:");
  EXPECT_EQ(q.substr(l.header_end, 6), "\r\nbody");
  ASSERT_EQ(l.header.size(), 2u);
  EXPECT_EQ(l.header[0], "Subject: hi\r\n there\r\n");
  EXPECT_EQ(header_field(l, "precedence"), "bulk");
  EXPECT_EQ(header_field(l, "Subject"), "hi\r\n there");
  // A message without a body ends its header at the terminator.
  QueueLayout bare = layout_of("MAIL FROM:<a@x>\r\nRCPT TO:<b@y>\r\nDATA\r\nSubject: s\r\n.\r\n");
  EXPECT_EQ(bare.header.size(), 1u);
}

TEST(Vacation, NoReplyToListsAutomataOrTheNullSender) {
  auto wanted = [](std::string_view header, std::string_view sender = "bob@x") {
    std::string q = "MAIL FROM:<bob@x>\r\nRCPT TO:<ann@y>\r\nDATA\r\n" + std::string(header) + "\r\nhi\r\n.\r\n";
    return vacation_reply_wanted(layout_of(q), sender);
  };
  EXPECT_TRUE(wanted("Subject: hello\r\n"));
  EXPECT_TRUE(wanted("Auto-Submitted: no\r\n"));
  EXPECT_FALSE(wanted("Subject: hello\r\n", ""));
  EXPECT_FALSE(wanted("Subject: hello\r\n", "<>"));
  EXPECT_FALSE(wanted("Subject: hello\r\n", "MAILER-DAEMON@x"));
  EXPECT_FALSE(wanted("Precedence: bulk\r\n"));
  EXPECT_FALSE(wanted("precedence: List\r\n"));
  EXPECT_FALSE(wanted("Precedence: junk\r\n"));
  EXPECT_FALSE(wanted("List-Id: <news.example.org>\r\n"));
  EXPECT_FALSE(wanted("Auto-Submitted: auto-replied\r\n"));
}

TEST(Vacation, AtMostOncePerSenderPerWeek) {
  testing_files::ScratchDir scratch;
  std::string record = (scratch.path() / ".vacation.sent").string();
  const std::time_t t0 = 1700000000, week = 7 * 24 * 3600;
  EXPECT_TRUE(vacation_note_sent(record, "bob@x", t0));
  EXPECT_FALSE(vacation_note_sent(record, "BOB@x", t0 + 3600));
  EXPECT_TRUE(vacation_note_sent(record, "carl@x", t0 + 3600));
  EXPECT_FALSE(vacation_note_sent(record, "bob@x", t0 + week - 1));
  EXPECT_TRUE(vacation_note_sent(record, "bob@x", t0 + week));
  // Old entries are dropped as the record is rewritten.
  EXPECT_TRUE(vacation_note_sent(record, "dave@x", t0 + 3 * week));
  EXPECT_EQ(read_file(record).find("bob"), std::string::npos);
  EXPECT_EQ(read_file(record).find("carl"), std::string::npos);
}

// The scratch queue with the user ann (home inside it) and one group that
// honours forward and vacation files.
class Delivery : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    dir_ = root;
    home_ = dir_ / "ann";
    fs::create_directories(home_);
    fs::create_directories(dir_ / "odd");
    write_file(dir_ / "users", "ann," + md5_crypt("pw", "$1$abcde$") + ",Ann Lee," + home_.string() + ",0\n");
    write_file(dir_ / "groups", "#0\n%mail.forward: yes\n%mail.vacation: yes\n%mail.pop.fetch: yes\n");
    ASSERT_EQ(user_load((dir_ / "users").string()), 0);
    ASSERT_EQ(groups_load((dir_ / "groups").string()), 0);
    mailbox_cache_clear();
  }
  void TearDown() override {
    mailbox_cache_clear();
    sysio::reset();
    server_now = 0;
    QueueFixture::TearDown();
  }

  std::string queue(std::string_view header, std::string_view body = "hello\r\n",
                    std::string_view sender = "bob@elsewhere.test") {
    std::string path = (dir_ / ("q" + std::to_string(++n_))).string();
    write_file(path, "MAIL FROM:<" + std::string(sender) + ">\r\nRCPT TO:<ann@site.example>\r\nDATA\r\n" +
                         std::string(header) + "\r\n" + std::string(body) + ".\r\n");
    return path;
  }
  std::string inbox() const { return (home_ / "mail" / "inbox").string(); }
  std::vector<std::string> incoming() {
    std::vector<std::string> out;
    for (const std::string& path : folder_names(root + "/in", true)) out.push_back(read_file(path));
    return out;
  }

  fs::path dir_, home_;
  int n_ = 0;
};

TEST_F(Delivery, StateHeadersAreReplacedAndIdentifiersRise) {
  std::string q1 = queue("From: bob@elsewhere.test\r\nStatus: RO\r\nX-UID: 77\r\nx-status: D\r\n"
                         "X-Keywords: x\r\n  continued\r\nSubject: first\r\n",
                         "\r\n\r\n.. dotted\r\nFrom here on\r\n");
  ASSERT_EQ(mailbox_append(q1, "ann@site.example", "bob@elsewhere.test"), 1);
  ASSERT_EQ(mailbox_append(queue("Subject: second\r\n"), "ann", "bob@elsewhere.test"), 1);
  std::string box = read_file(inbox());
  EXPECT_EQ(box.find("Status:"), std::string::npos);
  EXPECT_EQ(box.find("X-UID: 77"), std::string::npos);
  EXPECT_EQ(box.find("status:"), std::string::npos);
  EXPECT_NE(box.find("X-Keywords: x\r\n  continued\r\n"), std::string::npos);
  EXPECT_NE(box.find("X-RCPT-TO: ann\r\nX-Processed-By: Velmor Mail Suite (2.0.49)\r\nX-UID: 1\r\n\r\n"
                     ".. dotted\r\nFrom here on\r\n.\r\n"),
            std::string::npos);
  EXPECT_NE(box.find("X-UID: 2\r\n\r\nhello\r\n.\r\n"), std::string::npos);
  Mailbox* m = mailbox_lookup(inbox());
  ASSERT_NE(m, nullptr);
  EXPECT_EQ(m->count, 2);
  EXPECT_EQ(m->unseen, 2);
  EXPECT_EQ(m->messages.front().flags & msgflag::deleted, 0u);
  EXPECT_TRUE(m->flags & boxflag::new_mail);
  // The cache and a fresh read of the files agree.
  std::string overview = mailbox_overview_text(*m);
  mailbox_cache_clear();
  Mailbox* again = mailbox_lookup(inbox());
  EXPECT_EQ(mailbox_overview_text(*again), overview);
}

TEST_F(Delivery, SubAddressChoosesABoxInsideTheMailFolder) {
  ASSERT_EQ(mailbox_append(queue("Subject: w\r\n"), "ann_work@site.example", "bob@x"), 1);
  EXPECT_TRUE(fs::exists(home_ / "mail" / "work"));
  EXPECT_TRUE(fs::exists(home_ / "mail" / "overview" / "work"));
  ASSERT_EQ(mailbox_append(queue("Subject: t\r\n"), "ann_../../etc@site.example", "bob@x"), 1);
  ASSERT_EQ(mailbox_append(queue("Subject: o\r\n"), "ann_overview@site.example", "bob@x"), 1);
  EXPECT_EQ(mailbox_lookup(inbox())->count, 2);
  EXPECT_EQ(mailbox_append(queue("Subject: n\r\n"), "nobody@site.example", "bob@x"), 0);
  EXPECT_EQ(mailbox_append(queue("Subject: n\r\n"), "ann@elsewhere.test", "bob@x"), 0);
}

TEST_F(Delivery, FullDiskKeepsTheQueueFileAndTheMailboxAsItWas) {
  ASSERT_EQ(mailbox_append(queue("Subject: fits\r\n"), "ann", "bob@x"), 1);
  std::string before = read_file(inbox());
  std::string overview = read_file(home_ / "mail" / "overview" / "inbox");
  std::string big = queue("Subject: too big\r\n", std::string(100000, 'y') + "\r\n");
  struct rlimit old_limit {};
  getrlimit(RLIMIT_FSIZE, &old_limit);
  auto old_handler = std::signal(SIGXFSZ, SIG_IGN);
  struct rlimit small = {static_cast<rlim_t>(before.size() + 50000), old_limit.rlim_max};
  setrlimit(RLIMIT_FSIZE, &small);
  int rc = mailbox_append(big, "ann", "bob@x");
  setrlimit(RLIMIT_FSIZE, &old_limit);
  std::signal(SIGXFSZ, old_handler);
  EXPECT_EQ(rc, kAppendTemporaryFailure);
  EXPECT_TRUE(fs::exists(big));
  EXPECT_EQ(read_file(inbox()), before);
  EXPECT_EQ(read_file(home_ / "mail" / "overview" / "inbox"), overview);
  EXPECT_EQ(mailbox_lookup(inbox())->count, 1);
  // Room again: the kept file goes in whole, with the next identifier.
  ASSERT_EQ(mailbox_append(big, "ann", "bob@x"), 1);
  EXPECT_EQ(mailbox_lookup(inbox())->messages.back().uid, 2u);
}

TEST_F(Delivery, AnAppendCountsOnlyOnceItAndItsLengthAreSynced) {
  ASSERT_EQ(mailbox_append(queue("Subject: fits\r\n"), "ann", "bob@x"), 1);
  std::string before = read_file(inbox());
  std::string overview = read_file(home_ / "mail" / "overview" / "inbox");
  std::string big = queue("Subject: big\r\n", std::string(200000, 'y') + "\r\n");
  // A write failing half way, the mailbox's sync, the overview's sync.
  for (auto [op, n] : {std::pair{sysio::Op::write, 2}, {sysio::Op::sync, 1}, {sysio::Op::sync, 2}}) {
    sysio::reset();
    sysio::fail_nth(op, n);
    EXPECT_EQ(mailbox_append(big, "ann", "bob@x"), kAppendTemporaryFailure);
    EXPECT_EQ(read_file(inbox()), before);
    EXPECT_EQ(read_file(home_ / "mail" / "overview" / "inbox"), overview);
    EXPECT_EQ(mailbox_lookup(inbox())->count, 1);
  }
  sysio::reset();
  ASSERT_EQ(mailbox_append(big, "ann", "bob@x"), 1);
  EXPECT_EQ(sysio::count(sysio::Op::sync), 2u);  // the mailbox, then the overview it is appended to
  EXPECT_EQ(mailbox_lookup(inbox())->messages.back().uid, 2u);
}

TEST_F(Delivery, AtMostTwentyNewBoxesPerUserAndDay) {
  server_now = 1700000000;
  auto to = [&](std::string box) { return mailbox_append(queue("Subject: s\r\n"), "ann_" + box + "@site.example", "b@x"); };
  for (int i = 0; i < 21; ++i) ASSERT_EQ(to("box" + std::to_string(i)), 1);
  EXPECT_TRUE(fs::exists(home_ / "mail" / "box19"));
  EXPECT_FALSE(fs::exists(home_ / "mail" / "box20"));
  EXPECT_EQ(mailbox_lookup(inbox())->count, 1);
  ASSERT_EQ(to("box3"), 1);  // boxes that exist still get their mail
  EXPECT_EQ(mailbox_lookup((home_ / "mail" / "box3").string())->count, 2);
  server_now += 24 * 3600;
  ASSERT_EQ(to("box20"), 1);
  EXPECT_TRUE(fs::exists(home_ / "mail" / "box20"));
}

TEST_F(Delivery, AHomeTheSuiteCannotWriteKeepsTheMessageWaiting) {
  std::string q = queue("Subject: wait\r\n");
  fs::permissions(dir_, fs::perms::owner_all | fs::perms::group_read | fs::perms::group_exec |
                            fs::perms::others_read | fs::perms::others_exec);
  fs::permissions(home_, fs::perms::owner_read | fs::perms::owner_exec | fs::perms::group_read |
                             fs::perms::group_exec | fs::perms::others_read | fs::perms::others_exec);
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {  // as root, the suite runs as another user here
    if (geteuid() == 0 && (setgroups(0, nullptr) != 0 || setresgid(4242, 4242, 4242) != 0 ||
                           setresuid(4242, 4242, 4242) != 0)) {
      _exit(99);
    }
    _exit(mailbox_append(q, "ann", "bob@x"));
  }
  int status = 0;
  waitpid(child, &status, 0);
  fs::permissions(home_, fs::perms::owner_all);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), kAppendTemporaryFailure);
  EXPECT_TRUE(fs::exists(q));
  EXPECT_FALSE(fs::exists(home_ / "mail"));
}

TEST_F(Delivery, ForwardGoesOnButNeverInACircle) {
  write_file(home_ / ".forward", "bob@elsewhere.test\n");
  ASSERT_EQ(mailbox_append(queue("Subject: fwd\r\n", "hello\r\n", "carl@x"), "ann", "carl@x"), 1);
  EXPECT_FALSE(fs::exists(inbox()));
  auto queued = incoming();
  ASSERT_EQ(queued.size(), 1u);
  EXPECT_EQ(queued[0].rfind("MAIL FROM:<carl@x>\r\nRCPT TO:<bob@elsewhere.test>\r\nDATA\r\n", 0), 0u);
  EXPECT_NE(queued[0].find("Subject: fwd\r\n\r\nhello\r\n.\r\n"), std::string::npos);

  // The message coming back through the same forward stays here.
  std::string back = (dir_ / "back").string();
  write_file(back, "MAIL FROM:<carl@x>\r\nRCPT TO:<ann@site.example>\r\n" + queued[0].substr(queued[0].find("DATA")));
  ASSERT_EQ(mailbox_append(back, "ann", "carl@x"), 1);
  EXPECT_EQ(mailbox_lookup(inbox())->count, 1);

  // A forward to oneself delivers here.
  write_file(home_ / ".forward", "<ann@site.example>\n");
  ASSERT_EQ(mailbox_append(queue("Subject: self\r\n"), "ann", "carl@x"), 1);
  EXPECT_EQ(mailbox_lookup(inbox())->count, 2);
  EXPECT_EQ(incoming().size(), 1u);
}

TEST_F(Delivery, VacationRepliesOnceAndMarksItsReply) {
  write_file(home_ / ".vacation", "Away until Monday.\n.hidden dot\n");
  ASSERT_EQ(mailbox_append(queue("Subject: one\r\n"), "ann", "bob@elsewhere.test"), 1);
  ASSERT_EQ(mailbox_append(queue("Subject: two\r\n"), "ann", "bob@elsewhere.test"), 1);
  ASSERT_EQ(mailbox_append(queue("Subject: list\r\nList-Id: <l.x>\r\n", "hi\r\n", "list@x"), "ann", "list@x"), 1);
  auto queued = incoming();
  ASSERT_EQ(queued.size(), 1u);
  const std::string& r = queued[0];
  EXPECT_EQ(r.rfind("MAIL FROM:<ann@site.example>\r\nRCPT TO:<bob@elsewhere.test>\r\nDATA\r\n", 0), 0u);
  EXPECT_NE(r.find("\r\nSubject: Vacation Message\r\n"), std::string::npos);
  EXPECT_NE(r.find("\r\nPrecedence: bulk\r\n"), std::string::npos);
  EXPECT_NE(r.find("\r\nAuto-Submitted: auto-replied\r\n"), std::string::npos);
  EXPECT_EQ(r.substr(r.size() - 41), "\r\n\r\nAway until Monday.\r\n..hidden dot\r\n.\r\n");
  EXPECT_EQ(mailbox_lookup(inbox())->count, 3);
}

TEST_F(Delivery, ARefusedMessageIsReportedWithItsHeaderOnly) {
  // The report of an oversize message must not carry the body that broke the
  // limit, or the report would be refused in turn.
  write_file(dir_ / "groups", "#0\n%mail.msg.size: 1\n");
  ASSERT_EQ(groups_load((dir_ / "groups").string()), 0);
  std::string body(4000, 'x');
  body += "\r\n";
  ASSERT_EQ(mailbox_append(queue("Subject: big\r\n", body), "ann", "bob@elsewhere.test"), 1);
  EXPECT_FALSE(fs::exists(inbox()));
  auto queued = incoming();
  ASSERT_EQ(queued.size(), 1u);
  EXPECT_NE(queued[0].find("RCPT TO:<bob@elsewhere.test>\r\n"), std::string::npos);
  EXPECT_NE(queued[0].find("greater than the 1kB length limit"), std::string::npos);
  EXPECT_NE(queued[0].find("Subject: big\r\n"), std::string::npos);
  EXPECT_EQ(queued[0].find("xxxxxxxx"), std::string::npos);
  EXPECT_LT(queued[0].size(), 1024u);
}

TEST_F(Delivery, ReadReceiptGoesOnceToTheSender) {
  ASSERT_EQ(mailbox_append(queue("From: \"Bob B\" <bob@elsewhere.test> (work)\r\nSubject: please confirm\r\n"
                                 "Date: Tue, 14 Nov 2023 22:13:20 +0000\r\nX-Read-Receipt: Yes\r\n"),
                           "ann", "bob@elsewhere.test"),
            1);
  ASSERT_EQ(mailbox_append(queue("From: carl@x\r\nSubject: no receipt\r\n"), "ann", "carl@x"), 1);
  Mailbox* box = mailbox_lookup(inbox());
  ASSERT_EQ(box->unseen, 2);
  MessageRecord& first = box->messages.front();
  EXPECT_TRUE(first.flags & msgflag::receipt_wanted);
  EXPECT_EQ(mailbox_mark_seen(*box, first, 0, "ann"), 0);
  EXPECT_EQ(mailbox_mark_seen(*box, first, 0, "ann"), 0);
  EXPECT_EQ(mailbox_mark_seen(*box, box->messages.back(), first.total_length, "ann"), 0);
  EXPECT_EQ(box->unseen, 0);
  auto queued = incoming();
  ASSERT_EQ(queued.size(), 1u);
  const std::string& r = queued[0];
  EXPECT_EQ(r.rfind("MAIL FROM:<ann@site.example>\r\nRCPT TO:<bob@elsewhere.test>\r\nDATA\r\n"
                    "To: \"Bob B\" <bob@elsewhere.test> (work)\r\nFrom: Ann Lee <ann@site.example>\r\n",
                    0),
            0u);
  EXPECT_NE(r.find("Subject: Read Receipt (Original:please confirm)\r\n"), std::string::npos);
  EXPECT_NE(r.find("     please confirm  (Tue, 14 Nov 2023 22:13:20 +0000)\r\n"), std::string::npos);
  EXPECT_EQ(r.substr(r.size() - 5), "\r\n.\r\n");
}


// ---- big mailboxes: the overview grows by appending -------------------------

// The records a fresh reader builds from the mailbox file alone.
std::string overview_parsed_from(const std::string& mailbox_text, std::uint32_t uid_validity) {
  Mailbox box;
  box.uid_validity = uid_validity;
  TextSource in(mailbox_text);
  for (std::uint64_t off = 0; off != kNoMessage;) off = mailbox_parse_message(in, off, box);
  return mailbox_overview_text(box);
}

class BigBox : public Delivery {
 protected:
  std::string overview_file() const { return (home_ / "mail" / "overview" / "inbox").string(); }
  // A varied message: status headers to drop, MIME parts, a read-receipt request.
  std::string varied(int i) {
    std::string header = "From: Bob <bob@elsewhere.test>\r\nSubject: number " + std::to_string(i) + "\r\n";
    if (i % 3 == 0) header += "Status: RO\r\nX-UID: 9999\r\n";
    if (i % 4 == 0) header += "X-Read-Receipt: yes\r\n";
    if (i % 5 == 0)
      return queue(header + "Content-Type: multipart/mixed; boundary=\"b\"\r\n",
                   "--b\r\nContent-Type: text/plain\r\n\r\none\r\n--b\r\n\r\ntwo\r\n--b--\r\n");
    return queue(header, std::string(static_cast<std::size_t>(50 + i % 7 * 40), 'x') + "\r\n");
  }
  // A fresh read of the files (as after a restart) agrees with the mailbox itself.
  void expect_consistent(int count) {
    std::string text = read_file(inbox());
    mailbox_cache_clear();
    Mailbox* box = mailbox_lookup(inbox());
    ASSERT_NE(box, nullptr);
    EXPECT_EQ(box->count, count);
    EXPECT_EQ(mailbox_size(*box), read_file(inbox()).size());
    EXPECT_EQ(read_file(inbox()), text.substr(0, mailbox_size(*box)));
    EXPECT_EQ(mailbox_overview_text(*box), overview_parsed_from(read_file(inbox()), box->uid_validity));
  }
};

TEST_F(BigBox, AfterManyAppendsTheOverviewEqualsOneRebuiltFromTheMailboxAndOnlyGrew) {
  std::vector<std::uint64_t> growth;
  std::string before;
  for (int i = 0; i < 60; ++i) {
    ASSERT_EQ(mailbox_append(i % 5 ? queue("Subject: same\r\n") : varied(i), "ann", "bob@x"), 1);
    std::string now_text = read_file(overview_file());
    ASSERT_EQ(now_text.substr(0, before.size()), before) << "rewritten at " << i;  // appended to, never rewritten
    if (i % 5) growth.push_back(now_text.size() - before.size());
    before = now_text;
  }
  // What an append adds does not depend on what the mailbox holds (the
  // numbers of its last lines grow by a digit or two).
  EXPECT_LE(growth.back(), growth.front() + 4);
  expect_consistent(60);
  Mailbox* box = mailbox_lookup(inbox());
  EXPECT_EQ(box->messages.back().uid, 60u);
  EXPECT_EQ(box->unseen, 60);  // Status headers of arriving mail count for nothing
}

TEST_F(BigBox, CompactionKeepsFlagsAndIdentifiersAndCarriesOverWhatHappensMeanwhile) {
  for (int i = 0; i < 300; ++i) ASSERT_EQ(mailbox_append(varied(i), "ann", "bob@x"), 1);
  Mailbox* box = mailbox_lookup(inbox());
  int n = 0;
  for (auto& m : box->messages) {
    if (n % 3 == 0) m.flags |= msgflag::deleted;
    if (n % 7 == 0) {
      m.flags |= msgflag::answered;
      mailbox_flags_changed(*box, m);
    }
    ++n;
  }
  ASSERT_EQ(mailbox_overview_flush(*box), 0);
  ASSERT_EQ(mailbox_expunge(*box), 0);
  EXPECT_NE(read_file(overview_file()).find("#expunge "), std::string::npos);
  std::string expected = mailbox_overview_text(*box);
  // A fresh reader of the records as appended sees the same.
  mailbox_cache_clear();
  box = mailbox_lookup(inbox());
  ASSERT_EQ(box->count, 200);
  ASSERT_EQ(mailbox_overview_text(*box), expected);

  // Compacted in slices (the deadline has passed: one slice per step), with
  // a delivery and a flag change between the slices.
  int steps = 0;
  CompactStep step;
  while ((step = mailbox_compact_step(*box, {})) == CompactStep::working) {
    if (++steps == 1) {
      ASSERT_EQ(mailbox_append(queue("Subject: meanwhile\r\n"), "ann", "bob@x"), 1);
      box->messages.front().flags |= msgflag::flagged;
      mailbox_flags_changed(*box, box->messages.front());
    }
  }
  ASSERT_EQ(step, CompactStep::done);
  EXPECT_GT(steps, 1);
  std::string compacted = read_file(overview_file());
  EXPECT_EQ(compacted.find("#expunge"), std::string::npos);
  EXPECT_FALSE(mailbox_overview_stale(*box));
  expected = mailbox_overview_text(*box);
  mailbox_cache_clear();
  box = mailbox_lookup(inbox());
  EXPECT_EQ(mailbox_overview_text(*box), expected);
  EXPECT_EQ(box->count, 201);
  EXPECT_TRUE(box->messages.front().flags & msgflag::flagged);
  EXPECT_EQ(box->messages.front().uid, 2u);
  EXPECT_EQ(box->messages.back().uid, 301u);
  EXPECT_FALSE(fs::exists(home_ / "mail" / "overview" / "inbox~"));
}

TEST_F(BigBox, AFailureAnywhereInAnAppendOrACompactionLeavesFilesThatReopenConsistently) {
  for (int i = 0; i < 40; ++i) ASSERT_EQ(mailbox_append(varied(i), "ann", "bob@x"), 1);
  std::string big = queue("Subject: big\r\n", std::string(300000, 'z') + "\r\n");
  int count = 40;
  for (sysio::Op op : {sysio::Op::write, sysio::Op::sync, sysio::Op::rename, sysio::Op::truncate}) {
    for (std::uint64_t n = 1;; ++n) {
      sysio::reset();
      sysio::fail_nth(op, n);
      int rc = mailbox_append(big, "ann", "bob@x");
      bool reached = sysio::count(op) >= n;
      sysio::reset();
      if (rc == 1) ++count;
      SCOPED_TRACE(testing::Message() << "op " << static_cast<int>(op) << " n " << n);
      expect_consistent(count);
      if (!reached) break;
    }
  }
  // A compaction failing at each write, sync and rename leaves the live
  // overview as it was.
  Mailbox* box = mailbox_lookup(inbox());
  for (auto& m : box->messages) m.flags |= (m.uid % 2) ? msgflag::deleted : 0;
  ASSERT_EQ(mailbox_expunge(*box), 0);
  count = box->count;
  for (sysio::Op op : {sysio::Op::write, sysio::Op::sync, sysio::Op::rename}) {
    std::string live = read_file(overview_file());
    sysio::reset();
    sysio::fail_nth(op, 1);
    CompactStep step;
    while ((step = mailbox_compact_step(*box, {})) == CompactStep::working) {
    }
    sysio::reset();
    EXPECT_EQ(step, CompactStep::failed);
    EXPECT_EQ(read_file(overview_file()), live);
    expect_consistent(count);
    box = mailbox_lookup(inbox());
  }
}

TEST_F(BigBox, AKillAnywhereInAnAppendLeavesNoMessageLostOrGlued) {
  for (int i = 0; i < 5; ++i) ASSERT_EQ(mailbox_append(varied(i), "ann", "bob@x"), 1);
  std::string m0 = read_file(inbox()), o0 = read_file(overview_file());
  ASSERT_EQ(mailbox_append(varied(5), "ann", "bob@x"), 1);
  std::string m1 = read_file(inbox()), o1 = read_file(overview_file());
  ASSERT_EQ(o1.substr(0, o0.size()), o0);
  // The mailbox is synced before the overview is appended to: a kill leaves
  // part of the message and the old overview, or the whole message and part
  // of the overview's new records.
  for (std::size_t cut = 1; cut < m1.size() - m0.size(); cut += 13) {
    write_file(inbox(), m1.substr(0, m0.size() + cut));
    write_file(overview_file(), o0);
    SCOPED_TRACE(cut);
    expect_consistent(5);
    EXPECT_EQ(read_file(inbox()), m0);
  }
  for (std::size_t cut = 0; cut <= o1.size() - o0.size(); cut += 7) {
    write_file(inbox(), m1);
    write_file(overview_file(), o1.substr(0, o0.size() + cut));
    SCOPED_TRACE(cut);
    expect_consistent(6);
    EXPECT_EQ(read_file(inbox()), m1);
  }
  // Whatever was cut off, the next message is whole and separate.
  ASSERT_EQ(mailbox_append(varied(6), "ann", "bob@x"), 1);
  expect_consistent(7);
  EXPECT_EQ(mailbox_lookup(inbox())->messages.back().subject, "number 6");
}

TEST_F(BigBox, AKillInACompactionLeavesTheLiveOverview) {
  for (int i = 0; i < 30; ++i) ASSERT_EQ(mailbox_append(varied(i), "ann", "bob@x"), 1);
  Mailbox* box = mailbox_lookup(inbox());
  box->messages.front().flags |= msgflag::deleted;
  ASSERT_EQ(mailbox_expunge(*box), 0);
  std::string live = read_file(overview_file());
  std::string compacted = mailbox_overview_text(*box);
  // Killed before the rename: the temporary file holds any part of the new text.
  for (std::size_t cut : {std::size_t{0}, compacted.size() / 3, compacted.size() - 1, compacted.size()}) {
    write_file(home_ / "mail" / "overview" / "inbox~", compacted.substr(0, cut));
    expect_consistent(29);
    EXPECT_EQ(read_file(overview_file()), live);
  }
  // The next compaction takes the leftover's place.
  box = mailbox_lookup(inbox());
  CompactStep step;
  while ((step = mailbox_compact_step(*box, {})) == CompactStep::working) {
  }
  ASSERT_EQ(step, CompactStep::done);
  EXPECT_EQ(read_file(overview_file()), compacted);
  EXPECT_FALSE(fs::exists(home_ / "mail" / "overview" / "inbox~"));
}

}  // namespace
}  // namespace velmor
