#include "mail/mailbox.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "core/fileio.h"
#include "core/util.h"
#include "mail/mailfile.h"
#include "core/test_files.h"

namespace velmor {
namespace {

namespace fs = std::filesystem;

std::string message(std::string_view sender, std::string_view header, std::string_view body) {
  return mailbox_separator(std::string("MAIL FROM:<") + std::string(sender) + ">", 1700000000) +
         std::string(header) + "\r\n" + std::string(body) + ".\r\n";
}

Mailbox parse(std::string_view text) {
  Mailbox box;
  TextSource in(text);
  std::uint64_t off = 0;
  while (off != kNoMessage) off = mailbox_parse_message(in, off, box);
  return box;
}

using testing_files::read_file;
using testing_files::write_file;

class TempDir : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = scratch_.path();
    ASSERT_FALSE(dir_.empty());
    fs::create_directories(dir_ / "mail");
    mailbox_cache_clear();
  }
  void TearDown() override { mailbox_cache_clear(); }
  std::string inbox() const { return (dir_ / "mail" / "inbox").string(); }
  testing_files::ScratchDir scratch_;
  fs::path dir_;
};

TEST(MailboxFormat, SeparatorCarriesSenderAsOneWordAndAReadableDate) {
  std::string sep = mailbox_separator("MAIL FROM:<ann@example.org>", 1700000000);
  EXPECT_EQ(sep.rfind("From ann@example.org ", 0), 0u);
  EXPECT_EQ(sep.substr(sep.size() - 2), "\r\n");
  EXPECT_EQ(mailbox_separator_date(sep), 1700000000);
  // No sender, an empty one, or one with blanks still leaves the date in place.
  EXPECT_EQ(mailbox_separator("MAIL FROM:", 1700000000).rfind("From unknown ", 0), 0u);
  EXPECT_EQ(mailbox_separator("MAIL FROM:<>", 1700000000).rfind("From unknown ", 0), 0u);
  std::string odd = mailbox_separator("MAIL FROM:<a b@c>", 1700000000);
  EXPECT_EQ(odd.rfind("From a_b@c ", 0), 0u);
  EXPECT_EQ(mailbox_separator_date(odd), 1700000000);
  EXPECT_EQ(mailbox_separator_date("From here on\r\n"), kBadDate);
  EXPECT_EQ(mailbox_separator_date("Subject: x\r\n"), kBadDate);
}

TEST(MailboxFormat, StateHeadersAreDroppedInAnyCase) {
  for (const char* h : {"Status: RO\r\n", "status: R\r\n", "X-UID: 77\r\n", "x-uid: 1\r\n", "X-UIDL: abc\r\n",
                        "X-Status: D\r\n", "x-status: DA\r\n", "X-RCPT-TO: eve\r\n", "From someone else\r\n"}) {
    EXPECT_TRUE(mailbox_header_dropped(h)) << h;
  }
  for (const char* h : {"From: ann@example.org\r\n", "Subject: Status: R\r\n", "X-Mailer: x\r\n",
                        "X-UIDVALIDITY: 3\r\n"}) {
    EXPECT_FALSE(mailbox_header_dropped(h)) << h;
  }
}

TEST(MailboxFormat, SubAddressNamesABoxOnlyWhenPlain) {
  EXPECT_EQ(mailbox_box_for_address("ann@example.org"), "inbox");
  EXPECT_EQ(mailbox_box_for_address("ann_work@example.org"), "work");
  EXPECT_EQ(mailbox_box_for_address("<ann_my-box.2@example.org>"), "my-box.2");
  EXPECT_EQ(mailbox_box_for_address("ann_a_b"), "a_b");
  for (const char* bad : {"ann_@x", "ann_.hidden@x", "ann_..@x", "ann_overview@x", "ann_OverView@x",
                          "ann_../../etc@x", "ann_a/b@x", "ann_a%2fb@x", "ann_a b@x", "ann_~root@x"}) {
    EXPECT_EQ(mailbox_box_for_address(bad), "inbox") << bad;
  }
  EXPECT_EQ(mailbox_box_for_address("ann_" + std::string(65, 'x') + "@x"), "inbox");
}

TEST(MailboxFormat, OverviewSitsInTheOverviewFolderBesideTheBox) {
  EXPECT_EQ(mailbox_overview_path("/home/ann/mail/work"), "/home/ann/mail/overview/work");
  EXPECT_EQ(mailbox_path_for_name("/home/ann", "InBoX"), "/home/ann/mail/inbox");
  EXPECT_EQ(mailbox_path_for_name("/home/ann", "mail/work"), "/home/ann/mail/work");
}

TEST(MailboxParse, MessagesSplitOnlyAfterATerminator) {
  std::string m1 = message("a@x", "From: A <a@x>\r\nTo: ann\r\nSubject: one\r\nX-UID: 5\r\n",
                           "From here on\r\nFrom b@x Tue Nov 14 22:13:20 2023\r\n..dot line\r\n");
  std::string m2 = message("b@x", "From: b@x\r\nSubject: two\r\nStatus: RO\r\nX-Status: A\r\n", "body\r\n");
  std::string m3 = message("c@x", "Subject: three\r\nX-Status: D\r\nX-Read-Receipt: Yes\r\n", "");
  Mailbox box = parse(m1 + m2 + m3);
  ASSERT_EQ(box.messages.size(), 3u);
  auto it = box.messages.begin();
  EXPECT_EQ(it->total_length, m1.size());
  EXPECT_EQ(it->subject, "one");
  EXPECT_EQ(it->from, "A <a@x>");
  EXPECT_EQ(it->uid, 5u);
  EXPECT_EQ(it->internal_date, 1700000000);
  EXPECT_EQ(it->total_length - it->length, mailbox_separator("MAIL FROM:<a@x>", 1700000000).size());
  EXPECT_EQ(m1.substr(it->header_length, 12), "From here on");
  ++it;
  EXPECT_EQ(it->total_length, m2.size());
  EXPECT_EQ(it->flags & (msgflag::seen | msgflag::answered), msgflag::seen | msgflag::answered);
  EXPECT_EQ(it->uid, 6u);  // none given: the next after the highest so far
  ++it;
  EXPECT_EQ(it->flags & (msgflag::deleted | msgflag::receipt_wanted | msgflag::seen),
            msgflag::deleted | msgflag::receipt_wanted);
  EXPECT_EQ(box.count, 3);
  EXPECT_EQ(box.unseen, 2);
  EXPECT_EQ(box.next_uid, 8u);
}

TEST(MailboxParse, IdentifiersOnlyRise) {
  // An X-UID at or below the one before (a hand-joined mailbox) or one that
  // leaves no room above it gets the next identifier: identifiers stay
  // unique and rising, so records appended later can name a message by it.
  Mailbox box = parse(message("a@x", "X-UID: 5\r\n", "1\r\n") + message("b@x", "X-UID: 3\r\n", "2\r\n") +
                      message("c@x", "X-UID: 6\r\n", "3\r\n") + message("d@x", "X-UID: 4294967295\r\n", "4\r\n"));
  std::vector<std::uint32_t> uids;
  for (const auto& m : box.messages) uids.push_back(m.uid);
  EXPECT_EQ(uids, (std::vector<std::uint32_t>{5, 6, 7, 8}));
  // An overview whose identifiers do not rise is not trusted.
  std::string text = mailbox_overview_text(box);
  std::size_t at = text.find(",6,");
  ASSERT_NE(at, std::string::npos);
  text.replace(at, 3, ",5,");
  Mailbox back;
  EXPECT_NE(mailbox_overview_parse(back, text), 0);
}

TEST(MailboxParse, FoldedHeadersKeepTheirFirstLineAndDatesParse) {
  std::string m = message("a@x",
                          "Subject: first part\r\n  second part\r\nDate: Tue, 14 Nov 2023 22:13:20 +0000\r\n"
                          "To: ann@x,\r\n\tbob@x\r\n",
                          "hi\r\n");
  Mailbox box = parse(m);
  ASSERT_EQ(box.messages.size(), 1u);
  EXPECT_EQ(box.messages.front().subject, "first part");
  EXPECT_EQ(box.messages.front().to, "ann@x,");
  EXPECT_EQ(box.messages.front().sent_date, 1700000000);
}

TEST(MailboxParse, MimePartsWithNestingAndClosingDelimiters) {
  std::string body =
      "preamble\r\n"
      "--b\r\nContent-Type: text/plain\r\n\r\nfirst\r\nline two\r\n"
      "--b\r\nContent-Type: multipart/alternative;\r\n boundary=\"in\"\r\nContent-Description: alt\r\n\r\n"
      "--in\r\nContent-Type: text/plain\r\nContent-Transfer-Encoding: quoted-printable\r\n\r\nq\r\n"
      "--in\r\nContent-Type: text/html\r\nContent-Transfer-Encoding: base64\r\nContent-ID: <x@y>\r\n\r\nPGI+\r\n"
      "--in--\r\n"
      "--b\r\nContent-Type: application/pdf\r\n\r\nPDF\r\n"
      "--b--\r\nepilogue\r\n";
  std::string m = message("a@x", "Content-Type: multipart/mixed; boundary=b\r\n", body);
  Mailbox box = parse(m);
  ASSERT_EQ(box.messages.size(), 1u);
  const MessageRecord& rec = box.messages.front();
  EXPECT_TRUE(rec.flags & msgflag::mime);
  std::vector<MimePart> parts(rec.parts.begin(), rec.parts.end());
  ASSERT_EQ(parts.size(), 5u);
  EXPECT_EQ(parts[0].content_type, "text/plain");
  EXPECT_EQ(m.substr(parts[0].body_offset, parts[0].length), "first\r\nline two\r\n");
  EXPECT_EQ(parts[0].lines, 2u);
  EXPECT_EQ(parts[1].description, "alt");
  EXPECT_EQ((std::pair{parts[1].level, parts[1].number}), (std::pair{1, 2}));
  EXPECT_EQ((std::pair{parts[2].level, parts[2].number}), (std::pair{2, 1}));
  EXPECT_EQ(parts[2].encoding, 4);
  EXPECT_EQ(parts[3].encoding, 3);
  EXPECT_EQ(parts[3].content_id, "<x@y>");
  EXPECT_EQ(m.substr(parts[3].body_offset, parts[3].length), "PGI+\r\n");
  // The container runs to the next delimiter of its own level.
  EXPECT_EQ(m.substr(parts[1].body_offset + parts[1].length, 5), "--b\r\n");
  EXPECT_EQ((std::pair{parts[4].level, parts[4].number}), (std::pair{1, 3}));
  EXPECT_EQ(m.substr(parts[4].body_offset, parts[4].length), "PDF\r\n");

  // The simplest form: two delimiters and the closing one give two parts.
  Mailbox two = parse(message("a@x", "Content-Type: multipart/mixed; boundary=\"b\"\r\n",
                              "--b\r\n\r\none\r\n--b\r\n\r\ntwo\r\n--b--\r\n"));
  ASSERT_EQ(two.messages.front().parts.size(), 2u);
  EXPECT_EQ(two.messages.front().parts.back().number, 2);
  EXPECT_EQ(two.messages.front().parts.back().level, 1);
}

TEST(MailboxParse, DamagedLastLinesNeverThrow) {
  for (const char* text : {"From a@x Tue Nov 14 22:13:20 2023\r\nSubject: s\r\nX", "X", "\r\nx"}) {
    EXPECT_NO_THROW(parse(text)) << text;
  }
}

TEST(MailboxOverview, RoundTripAndCutOffFilesAreRefused) {
  std::string m = message("a@x", "Content-Type: multipart/mixed; boundary=b\r\nSubject: s\r\nX-UID: 9\r\n",
                          "--b\r\nContent-Type: text/plain\r\n\r\nx\r\n--b--\r\n") +
                  message("b@x", "Subject: t\r\n", "y\r\n");
  Mailbox box = parse(m);
  box.next_uid = 40;  // identifiers of removed messages stay used
  std::string text = mailbox_overview_text(box);
  Mailbox back;
  ASSERT_EQ(mailbox_overview_parse(back, text), 0);
  EXPECT_EQ(mailbox_overview_text(back), text);
  EXPECT_EQ(back.next_uid, 40u);
  EXPECT_EQ(back.count, 2);
  for (std::size_t cut : {text.size() - 1, text.find("#mime") + 7, text.rfind("#end"), text.rfind("#msg")}) {
    Mailbox partial;
    EXPECT_NE(mailbox_overview_parse(partial, text.substr(0, cut)), 0) << cut;
  }
}

TEST_F(TempDir, LookupBuildsTheOverviewAndNoticesAStaleOne) {
  std::string m1 = message("a@x", "Subject: one\r\n", "1\r\n"), m2 = message("b@x", "Subject: two\r\n", "2\r\n");
  write_file(inbox(), m1 + m2);
  EXPECT_EQ(mailbox_lookup((dir_ / "nothing").string()), nullptr);
  EXPECT_EQ(mailbox_lookup((dir_ / "mail").string()), nullptr);  // a folder is no mailbox
  Mailbox* box = mailbox_lookup(inbox());
  ASSERT_NE(box, nullptr);
  EXPECT_EQ(box->count, 2);
  EXPECT_TRUE(fs::exists(dir_ / "mail" / "overview" / "inbox"));

  // A message appended behind the cache's back is picked up.
  std::string m3 = message("c@x", "Subject: three\r\n", "3\r\n");
  write_file(inbox(), m1 + m2 + m3);
  EXPECT_EQ(mailbox_lookup(inbox())->count, 3);

  // After a restart, an overview older than the mailbox is not trusted.
  mailbox_cache_clear();
  write_file(inbox(), m2);
  Mailbox* again = mailbox_lookup(inbox());
  ASSERT_EQ(again->count, 1);
  EXPECT_EQ(again->messages.front().subject, "two");
  EXPECT_GE(again->next_uid, 4u);  // identifiers never go back
}

TEST_F(TempDir, ExpungeKeepsTheOthersByteForByte) {
  std::string m1 = message("a@x", "Subject: one\r\n", "1\r\n"), m2 = message("b@x", "Subject: two\r\n", "2\r\n"),
              m3 = message("c@x", "Subject: three\r\n", "3\r\n");
  write_file(inbox(), m1 + m2 + m3);
  Mailbox* box = mailbox_lookup(inbox());
  ASSERT_NE(box, nullptr);
  EXPECT_EQ(mailbox_expunge(*box), 0);  // nothing deleted, nothing written
  auto it = box->messages.begin();
  it->flags |= msgflag::deleted;
  std::next(it, 2)->flags |= msgflag::deleted;
  ASSERT_EQ(mailbox_expunge(*box), 0);
  EXPECT_EQ(read_file(inbox()), m2);
  EXPECT_EQ(box->count, 1);
  EXPECT_FALSE(fs::exists(dir_ / "mail" / "inbox~"));
  mailbox_cache_clear();
  Mailbox* reread = mailbox_lookup(inbox());
  ASSERT_EQ(reread->count, 1);
  EXPECT_EQ(reread->messages.front().subject, "two");
  EXPECT_EQ(reread->next_uid, 4u);

  // Removing the last message leaves an empty mailbox that remembers its
  // next identifier.
  reread->messages.front().flags |= msgflag::deleted;
  ASSERT_EQ(mailbox_expunge(*reread), 0);
  EXPECT_EQ(fs::file_size(inbox()), 0u);
  mailbox_cache_clear();
  EXPECT_EQ(mailbox_lookup(inbox())->next_uid, 4u);
}

TEST_F(TempDir, FailedExpungeLeavesTheOldMailbox) {
  std::string m1 = message("a@x", "Subject: one\r\n", std::string(200000, 'x') + "\r\n"),
              m2 = message("b@x", "Subject: two\r\n", "2\r\n");
  write_file(inbox(), m1 + m2);
  Mailbox* box = mailbox_lookup(inbox());
  box->messages.back().flags |= msgflag::deleted;
  // The new mailbox cannot be written in full.
  struct rlimit old_limit {};
  getrlimit(RLIMIT_FSIZE, &old_limit);
  auto old_handler = std::signal(SIGXFSZ, SIG_IGN);
  struct rlimit small = {100000, old_limit.rlim_max};
  setrlimit(RLIMIT_FSIZE, &small);
  int rc = mailbox_expunge(*box);
  setrlimit(RLIMIT_FSIZE, &old_limit);
  std::signal(SIGXFSZ, old_handler);
  EXPECT_NE(rc, 0);
  EXPECT_EQ(read_file(inbox()), m1 + m2);
  EXPECT_EQ(box->count, 2);
  EXPECT_FALSE(fs::exists(dir_ / "mail" / "inbox~"));
}

TEST_F(TempDir, KilledExpungeLeavesTheOldOrTheNewMailboxWhole) {
  std::string old_text, new_text;
  for (int i = 0; i < 30; ++i) {
    std::string m = message("a@x", "Subject: " + std::to_string(i) + "\r\nX-UID: " + std::to_string(i + 1) + "\r\n",
                            std::string(300000, 'a' + i % 26) + "\r\n");
    old_text += m;
    if (i) new_text += m;
  }
  write_file(inbox(), old_text);
  Mailbox* box = mailbox_lookup(inbox());
  ASSERT_EQ(box->count, 30);
  box->messages.front().flags |= msgflag::deleted;
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    mailbox_expunge(*box);
    _exit(0);
  }
  // Kill it as soon as the new mailbox is being written.
  std::string tmp = (dir_ / "mail" / "inbox~").string();
  for (int i = 0; i < 5000; ++i) {
    std::error_code ec;
    if (fs::exists(tmp, ec) && fs::file_size(tmp, ec) > 1000000) break;
    usleep(1000);
  }
  kill(child, SIGKILL);
  int status = 0;
  waitpid(child, &status, 0);
  std::string after = read_file(inbox());
  EXPECT_TRUE(after == old_text || after == new_text);
  mailbox_cache_clear();
  Mailbox* reread = mailbox_lookup(inbox());
  EXPECT_EQ(reread->count, after == old_text ? 30 : 29);
  EXPECT_EQ(mailbox_size(*reread), after.size());
}

TEST_F(TempDir, AnInterruptedAppendIsCutBackBeforeAnythingElse) {
  std::string m1 = message("a@x", "Subject: one\r\n", "1\r\n"), m2 = message("b@x", "Subject: two\r\n", "2\r\n");
  write_file(inbox(), m1);
  ASSERT_EQ(mailbox_lookup(inbox())->count, 1);
  std::string fragment = m2.substr(0, m2.size() - 4);
  write_file(inbox(), m1 + fragment);
  EXPECT_EQ(mailbox_lookup(inbox())->count, 1);
  EXPECT_EQ(read_file(inbox()), m1);
  // After a restart, the overview's committed length tells the same.
  write_file(inbox(), m1 + fragment);
  mailbox_cache_clear();
  EXPECT_EQ(mailbox_lookup(inbox())->count, 1);
  EXPECT_EQ(read_file(inbox()), m1);
}

TEST_F(TempDir, ExpungeSyncsTheNewMailboxBeforeItReplacesTheOld) {
  std::string m1 = message("a@x", "Subject: one\r\n", "1\r\n"), m2 = message("b@x", "Subject: two\r\n", "2\r\n");
  write_file(inbox(), m1 + m2);
  Mailbox* box = mailbox_lookup(inbox());
  box->messages.front().flags |= msgflag::deleted;
  for (sysio::Op op : {sysio::Op::sync, sysio::Op::rename}) {
    sysio::reset();
    sysio::fail_nth(op, 1);
    EXPECT_NE(mailbox_expunge(*box), 0);
    EXPECT_EQ(read_file(inbox()), m1 + m2);
    EXPECT_EQ(box->count, 2);
    EXPECT_FALSE(fs::exists(dir_ / "mail" / "inbox~"));
  }
  sysio::reset();
  ASSERT_EQ(mailbox_expunge(*box), 0);
  EXPECT_EQ(read_file(inbox()), m2);
  EXPECT_EQ(sysio::count(sysio::Op::sync), 4u);  // the new mailbox and its folder, the overview and its folder
}

TEST_F(TempDir, InUseMarksExclusiveOrSharedWithOnePop3Session) {
  write_file(inbox(), message("a@x", "Subject: one\r\n", "1\r\n"));
  Mailbox* box = mailbox_lookup(inbox());
  EXPECT_TRUE(mailbox_take(*box, 7));
  EXPECT_TRUE(mailbox_take(*box, 7));
  EXPECT_FALSE(mailbox_take(*box, 8));
  mailbox_release(*box, 8);  // not the holder: no effect
  EXPECT_FALSE(mailbox_take(*box, 8));
  EXPECT_FALSE(mailbox_share(*box, 8, nullptr));
  EXPECT_FALSE(mailbox_share_pop(*box, 8));
  mailbox_release(*box, 7);
  // IMAP sessions and one POP3 session at a time share it; the exclusive
  // mark waits for all of them.
  EXPECT_TRUE(mailbox_share(*box, 1, nullptr));
  EXPECT_TRUE(mailbox_share_pop(*box, 2));
  EXPECT_FALSE(mailbox_share_pop(*box, 3));
  EXPECT_TRUE(mailbox_share(*box, 4, nullptr));
  EXPECT_FALSE(mailbox_take(*box, 5));
  mailbox_release(*box, 2);
  EXPECT_TRUE(mailbox_share_pop(*box, 3));
  for (std::uint64_t owner : {1, 3, 4}) mailbox_release(*box, owner);
  EXPECT_TRUE(mailbox_take(*box, 5));
}

}  // namespace
}  // namespace velmor
