#include <sys/resource.h>

#include <chrono>
#include <csignal>

#include "mail/alias.h"
#include "mail/mailbox.h"
#include "mail/queue_test_fixture.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {
namespace {

// Debatch against real mailboxes; a file-size limit plays the full disk.
class DebatchTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    config.mail_domains = "site.example";
    for (const char* d : {"/home", "/home/ann", "/home/ann/mail"}) mkdir((root + d).c_str(), 0770);
    write_file(root + "/users", "ann,x,Ann," + root + "/home/ann,0\nbob,x,Bob," + root + "/home/bob,1\ncarl,x,Carl," +
                                    root + "/home/carl,1\n");
    write_file(root + "/groups", "#0\n%group.name: all\n%mail.override: yes\n#1\n%group.name: staff\n");
    alias_table().clear();
    ASSERT_EQ(user_load(root + "/users"), 0);
    ASSERT_EQ(groups_load(root + "/groups"), 0);
  }

  // Runs `work` while no file may grow past the inbox's current size.
  template <class Work>
  void debatch_with_full_disk_during(Work work) {
    std::string inbox = root + "/home/ann/mail/inbox";
    write_file(inbox, std::string(200000, 'x'));
    std::signal(SIGXFSZ, SIG_IGN);
    rlimit old{}, small{200000, 200000};
    getrlimit(RLIMIT_FSIZE, &old);
    small.rlim_max = old.rlim_max;
    setrlimit(RLIMIT_FSIZE, &small);
    work();
    setrlimit(RLIMIT_FSIZE, &old);
    EXPECT_EQ(read_file(inbox), std::string(200000, 'x'));  // the mailbox as it was
  }
  void debatch_with_full_disk(const std::string& file) {
    debatch_with_full_disk_during([&] { debatch_file(file); });
  }
};

const char* const kMessage = "DATA\r\nSubject: s\r\n\r\nbody\r\n.\r\n";

TEST_F(DebatchTest, DeliversLocallyAndOutwardsThenDeletesTheFile) {
  std::string file = root + "/in/5";
  write_file(file, std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\nRCPT TO:<b@far.example>\r\n") +
                 kMessage);
  debatch_file(file);
  EXPECT_NE(read_file(root + "/home/ann/mail/inbox").find("\r\nX-RCPT-TO: ann\r\n"), std::string::npos);
  std::vector<std::string> out = folder_names(root + "/out", true);
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(read_file(out[0]), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<b@far.example>\r\n") + kMessage);
  EXPECT_EQ(file_size(file), -1);
}

TEST_F(DebatchTest, ATemporaryFailureWithNoOtherCopyLeavesTheFileQueued) {
  std::string text = std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage;
  std::string file = root + "/in/6";
  write_file(file, text);
  debatch_with_full_disk(file);
  EXPECT_EQ(read_file(file), text);
  EXPECT_TRUE(folder_names(root + "/odd", true).empty());
  EXPECT_TRUE(folder_names(root + "/out", true).empty());
  EXPECT_TRUE(queue_incoming().empty());  // no error mail either
}

TEST_F(DebatchTest, ATemporaryFailureKeepsTheFileForTheRecipientsLeft) {
  std::string text =
      std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<b@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage;
  std::string file = root + "/in/7";
  write_file(file, text);
  debatch_with_full_disk(file);
  EXPECT_EQ(read_file(file), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage);
  ASSERT_EQ(folder_names(root + "/out", true).size(), 1u);  // b got it
  debatch_file(file);  // the later try reaches ann and nobody else
  EXPECT_EQ(file_size(file), -1);
  EXPECT_EQ(folder_names(root + "/out", true).size(), 1u);
  EXPECT_NE(read_file(root + "/home/ann/mail/inbox").find("X-RCPT-TO: ann"), std::string::npos);

  // The rewrite is renamed into place: failing, it leaves the whole file.
  write_file(file, text);
  sysio::reset();
  sysio::fail_nth(sysio::Op::rename, 2);  // the outgoing file's is the first
  debatch_with_full_disk(file);
  sysio::reset();
  EXPECT_EQ(read_file(file), text);
  EXPECT_EQ(folder_names(root + "/in"), std::vector<std::string>{"7"});
}

TEST_F(DebatchTest, EachMailboxAndAddressGetsOneCopyAndRecipientsTakeOneStepEach) {
  alias_table() = alias_parse("team ann,bob,x@far.example\n");
  std::string file = root + "/in/10";
  write_file(file, std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\nRCPT TO:<ANN@site.example>\r\n"
                               "RCPT TO:<team@site.example>\r\nRCPT TO:<bob_work@site.example>\r\n"
                               "RCPT TO:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n") +
                       kMessage);
  queue_add_incoming(file);
  EXPECT_EQ(debatch_step({}), DebatchStep::working);  // the deadline has passed: one recipient
  EXPECT_EQ(read_file(root + "/home/bob/mail/inbox"), "");
  int steps = 1;
  while (debatch_step({}) == DebatchStep::working) ++steps;
  EXPECT_EQ(steps, 5);
  for (const char* box : {"ann/mail/inbox", "bob/mail/inbox", "bob/mail/work"}) {
    std::string text = read_file(root + "/home/" + box);
    EXPECT_TRUE(text.find("X-UID:") != std::string::npos && text.find("X-UID:") == text.rfind("X-UID:")) << box;
  }
  std::vector<std::string> out = folder_names(root + "/out", true);
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(read_file(out[0]), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<x@far.example>\r\n") + kMessage);
  EXPECT_EQ(file_size(file), -1);
}

TEST_F(DebatchTest, AFileWithoutRecipientsOrBodyGoesToOddments) {
  write_file(root + "/in/8", std::string("MAIL FROM:<x@far.example>\r\n") + kMessage);
  debatch_file(root + "/in/8");
  write_file(root + "/in/9", "MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n");
  debatch_file(root + "/in/9");
  // Nor is a recipient guessed from a line too long to read whole.
  write_file(root + "/in/10", "MAIL FROM:<x@far.example>\r\nRCPT TO:" + std::string(4072, ' ') +
                                  "<victim@evil.org.example.com>\r\n" + kMessage);
  debatch_file(root + "/in/10");
  write_file(in("11"), "MAIL FROM:<x@far.example>\r\nRCPT TO:<" + std::string(300, 'x') + "@far.example>\r\n" + kMessage);
  debatch_file(in("11"));
  EXPECT_EQ(folder_names(root + "/odd", true).size(), 4u);
  EXPECT_TRUE(folder_names(root + "/out", true).empty());
  EXPECT_TRUE(folder_names(root + "/in", true).empty());
}

TEST_F(DebatchTest, FetchedMailGoesByTheListedHeaderOrTheAliasesAndNeverOutward) {
  config.pop_headers = "X-Envelope-To, Delivered-To";
  const std::string fetched = "POP3 MAIL FROM:<acct@isp.example>\r\nRCPT TO:<acct@isp.example>\r\nDATA\r\n";
  write_file(in("1"), fetched + "Delivered-To: Ann <ann@site.example>\r\nSubject: s\r\n\r\nbody\r\n.\r\n");
  debatch_file(in("1"));
  EXPECT_NE(read_file(root + "/home/ann/mail/inbox").find("Subject: s"), std::string::npos);
  EXPECT_EQ(file_size(in("1")), -1);
  // No listed header, nobody local behind the account's address, nor behind
  // the header's, nor behind an alias that points outside: oddments, never
  // the outgoing queue (it would go back to the provider).
  alias_table() = alias_parse("other@isp.example friend@far.example\n");
  write_file(in("2"), fetched + "Subject: s\r\n\r\nbody\r\n.\r\n");
  write_file(in("3"), fetched + "Delivered-To: nosuch@site.example\r\n\r\nbody\r\n.\r\n");
  write_file(in("4"), fetched + "X-Envelope-To: other@isp.example\r\n\r\nbody\r\n.\r\n");
  for (const char* n : {"2", "3", "4"}) debatch_file(in(n));
  EXPECT_TRUE(folder_names(root + "/out", true).empty());
  EXPECT_TRUE(queue_incoming().empty());  // and nobody was sent an error mail
  EXPECT_EQ(folder_names(root + "/odd", true).size(), 3u);
  // An alias of the account's address delivers it.
  alias_table() = alias_parse("acct@isp.example bob\n");
  write_file(in("5"), fetched + "Subject: t\r\n\r\nbody\r\n.\r\n");
  debatch_file(in("5"));
  EXPECT_NE(read_file(root + "/home/bob/mail/inbox").find("Subject: t"), std::string::npos);
  EXPECT_EQ(folder_names(root + "/odd", true).size(), 3u);
  // An error mail keeps the null sender under a forced sender, so nobody answers it.
  config.mail_from_force = "relay@site.example";
  write_file(in("6"), std::string("MAIL FROM:<>\r\nRCPT TO:<c@far.example>\r\n") + kMessage);
  debatch_file(in("6"));
  std::vector<std::string> out = folder_names(root + "/out", true);
  ASSERT_EQ(out.size(), 1u);
  EXPECT_EQ(read_file(out[0]), std::string("MAIL FROM:<>\r\nRCPT TO:<c@far.example>\r\n") + kMessage);
}

TEST_F(DebatchTest, PostmasterMailGoesToTheAdministratorOrWaitsInOddments) {
  auto postmaster = [&](const std::string& name, const char* to) {
    write_file(in(name), "MAIL FROM:<x@far.example>\r\nRCPT TO:<" + std::string(to) + ">\r\n" + kMessage);
    debatch_file(in(name));
  };
  config.admin_email = "bob";  // admin.email's local user
  postmaster("1", "PostMaster@site.example");
  EXPECT_NE(read_file(root + "/home/bob/mail/inbox").find("Subject: s"), std::string::npos);
  alias_table() = alias_parse("postmaster carl\n");  // an alias comes first
  postmaster("2", "postmaster");
  EXPECT_NE(read_file(root + "/home/carl/mail/inbox").find("Subject: s"), std::string::npos);
  alias_table().clear();
  config.admin_email = "ops@far.example";  // an administrator elsewhere
  postmaster("3", "postmaster@site.example");
  std::vector<std::string> out = folder_names(root + "/out", true);
  ASSERT_EQ(out.size(), 1u);
  EXPECT_NE(read_file(out[0]).find("RCPT TO:<ops@far.example>\r\n"), std::string::npos);
  // Nobody at all: kept for the operator, and no error mail to the sender.
  config.admin_email = "postmaster";
  postmaster("4", "postmaster@site.example");
  EXPECT_EQ(folder_names(root + "/odd", true).size(), 1u);
  EXPECT_TRUE(queue_incoming().empty());
  EXPECT_TRUE(folder_names(root + "/in", true).empty());
}

TEST_F(DebatchTest, GroupMailReachesEveryMemberOnlyFromAPermittedSender) {
  write_file(in("1"), std::string("MAIL FROM:<ann@site.example>\r\nRCPT TO:<+1>\r\n") + kMessage);
  debatch_file(in("1"));
  EXPECT_NE(read_file(root + "/home/bob/mail/inbox").find("X-RCPT-TO: bob"), std::string::npos);
  EXPECT_NE(read_file(root + "/home/carl/mail/inbox").find("X-RCPT-TO: carl"), std::string::npos);
  write_file(in("2"), std::string("MAIL FROM:<bob@site.example>\r\nRCPT TO:<+0>\r\n") + kMessage);
  debatch_file(in("2"));
  EXPECT_EQ(read_file(root + "/home/ann/mail/inbox"), "");
  std::string reports;
  for (const std::string& p : queue_incoming()) reports += read_file(p);
  EXPECT_NE(reports.find("RCPT TO:<bob@site.example>"), std::string::npos);
  EXPECT_NE(reports.find("You do not have the permission to email group 0"), std::string::npos);
}

TEST_F(DebatchTest, DebatchStartsAfterTheQuietTimeAndRetriesAMinuteAfterAFailure) {
  config.mail_debatch_time = 30;
  server_now = 100000;
  mail_poll();  // settles what earlier tests left
  mail_note_traffic();
  write_file(in("1"), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage);
  queue_scan_incoming();
  server_now += 30;
  mail_poll();
  EXPECT_EQ(queue_incoming().size(), 1u);  // not quiet for long enough yet
  server_now += 1;
  debatch_with_full_disk_during([] { mail_poll(); });
  EXPECT_TRUE(queue_incoming().empty());  // tried and left in the folder
  server_now += kRetrySeconds - 1;
  mail_poll();
  EXPECT_EQ(read_file(root + "/home/ann/mail/inbox"), std::string(200000, 'x'));
  server_now += 1;
  mail_poll();
  EXPECT_NE(read_file(root + "/home/ann/mail/inbox").find("X-RCPT-TO: ann"), std::string::npos);
  EXPECT_EQ(file_size(in("1")), -1);
}


TEST_F(DebatchTest, ABurstToOneMailboxSharesOneSyncOfTheMailboxAndOneOfItsOverview) {
  // The mailbox and its overview exist already.
  write_file(in("1"), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage);
  debatch_file(in("1"));
  for (int i = 2; i <= 11; ++i) {
    write_file(in(std::to_string(i)), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage);
    queue_add_incoming(in(std::to_string(i)));
  }
  // The overview's sync fails: no file is settled, the mailbox is as it was.
  std::string before = read_file(root + "/home/ann/mail/inbox");
  sysio::reset();
  sysio::fail_nth(sysio::Op::sync, 2);
  auto far = std::chrono::steady_clock::now() + std::chrono::hours(1);
  while (debatch_step(far) != DebatchStep::idle) {
  }
  EXPECT_EQ(read_file(root + "/home/ann/mail/inbox"), before);
  EXPECT_EQ(folder_names(root + "/in", true).size(), 10u);
  // Tried again: ten messages, one sync of the mailbox and one of its overview.
  sysio::reset();
  queue_scan_incoming();
  while (debatch_step(far) != DebatchStep::idle) {
  }
  EXPECT_EQ(sysio::count(sysio::Op::sync), 2u);
  EXPECT_TRUE(folder_names(root + "/in", true).empty());
  mailbox_cache_clear();
  EXPECT_EQ(mailbox_lookup(root + "/home/ann/mail/inbox")->count, 11);
}

TEST_F(DebatchTest, ALargeMessageGoesInPiecesAndStartsAgainWhenTheMailboxIsReplaced) {
  for (const char* n : {"1", "2"}) {
    write_file(in(n), std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\nDATA\r\nSubject: small ") +
                          n + "\r\n\r\nbody\r\n.\r\n");
    debatch_file(in(n));
  }
  std::string inbox = root + "/home/ann/mail/inbox";
  std::string body;
  for (int i = 0; i < 60000; ++i) body += "line " + std::to_string(i) + " of a long message\r\n";
  write_file(in("3"), "MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\nDATA\r\nSubject: large\r\n\r\n" + body +
                          ".\r\n");
  queue_add_incoming(in("3"));
  int pieces = 0;
  bool expunged = false;
  DebatchStep step;
  while ((step = debatch_step({})) == DebatchStep::working) {
    ++pieces;
    // A reader meanwhile sees the two messages, and what is being written stays.
    Mailbox* box = mailbox_lookup(inbox);
    ASSERT_EQ(box->count, expunged ? 1 : 2);
    if (pieces == 2) {
      box->messages.front().flags |= msgflag::deleted;
      ASSERT_EQ(mailbox_expunge(*box), 0);
      expunged = true;
    }
  }
  EXPECT_EQ(step, DebatchStep::finished);
  EXPECT_GE(pieces, 4);
  EXPECT_EQ(file_size(in("3")), -1);
  mailbox_cache_clear();
  Mailbox* box = mailbox_lookup(inbox);
  ASSERT_EQ(box->count, 2);
  EXPECT_EQ(box->messages.front().subject, "small 2");
  EXPECT_EQ(box->messages.back().subject, "large");
  std::string text = read_file(inbox);
  EXPECT_EQ(text.find("Subject: large"), text.rfind("Subject: large"));
  EXPECT_NE(text.find(body + ".\r\n"), std::string::npos);
  EXPECT_EQ(mailbox_size(*box), text.size());
}

}  // namespace
}  // namespace velmor
