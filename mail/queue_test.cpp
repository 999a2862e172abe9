#include <unistd.h>

#include "mail/queue_test_fixture.h"

namespace velmor {
namespace {

using QueueTest = QueueFixture;

TEST_F(QueueTest, NamesAreNeverReusedAndUnfinishedFilesVanishAtStart) {
  write_file(in("10000"), "held mail");  // left by an earlier run with the same clock
  std::string a = queue_new_incoming_name();
  std::string b = queue_new_incoming_name();
  EXPECT_EQ(a, in("10001"));
  EXPECT_EQ(b, in("10002"));
  EXPECT_EQ(read_file(in("10000")), "held mail");
  // The names are reserved under the hidden names the files are written as.
  EXPECT_EQ(folder_names(root + "/in"), (std::vector<std::string>{".10001.new", ".10002.new", "10000"}));

  CacheFile f = queue_create_incoming();
  ASSERT_TRUE(f);
  ASSERT_EQ(filecache_write(f, "MAIL FROM:<a@b>\r\n"), 0);
  std::string path = filecache_path(f);
  EXPECT_EQ(file_size(path), -1);  // invisible to scans until closed
  ASSERT_EQ(filecache_close(f), 0);
  EXPECT_EQ(read_file(path), "MAIL FROM:<a@b>\r\n");

  queue_init(1000);  // a restart: the unfinished reservations go
  EXPECT_EQ(folder_names(root + "/in"), (std::vector<std::string>{"10000", "10003"}));
  queue_scan_incoming();
  EXPECT_EQ(queue_incoming(), (std::list<std::string>{in("10000"), in("10003")}));
  EXPECT_EQ(queue_new_incoming_name(), in("10001"));
}

TEST_F(QueueTest, ATransferIsRequestedWhenTheOutgoingQueueReachesItsMarkOffline) {
  config.mail_auto_send = 2;
  link_up = 0;
  mail_transfer_state = 0;
  for (const char* n : {"1", "2", "3"}) write_file(root + "/out/" + n, "MAIL FROM:<a@b>\r\nRCPT TO:<c@d>\r\nDATA\r\nx\r\n.\r\n");
  queue_add_outgoing(root + "/out/1");
  EXPECT_EQ(mail_transfer_state, 0);
  queue_add_outgoing(root + "/out/2");
  EXPECT_EQ(mail_transfer_state, 4);
  mail_transfer_state = 0;
  link_up = 1;  // online, the send run takes the queue anyway
  queue_add_outgoing(root + "/out/3");
  EXPECT_EQ(mail_transfer_state, 0);
  link_up = 0;
}

TEST_F(QueueTest, LocalUsersAndThePrimaryDomain) {
  EXPECT_EQ(mail_local_user("ann@site.example"), "ann");
  EXPECT_EQ(mail_local_user("<ann_work@LOCALHOST>"), "ann");
  EXPECT_EQ(mail_local_user(":<bob>"), "bob");
  EXPECT_EQ(mail_local_user("carl"), "carl");
  EXPECT_EQ(mail_local_user("ann@far.example"), std::nullopt);
  EXPECT_EQ(mail_local_user("ann@"), std::nullopt);
  EXPECT_EQ(mail_local_user("<>"), std::nullopt);
  EXPECT_EQ(mail_local_user(""), std::nullopt);
  EXPECT_EQ(mail_primary_domain(), "site.example");
  config.mail_domains.reset();
  config.server_name = "host.example";
  EXPECT_EQ(mail_primary_domain(), "host.example");
  EXPECT_EQ(mail_local_user("ann@site.example"), std::nullopt);
}

TEST_F(QueueTest, TheFirstMatchingRejectLineDecides) {
  config.mail_file_smtpreject = root + "/reject";
  write_file(root + "/reject", "!boss@corp.example\n*@corp.example  spammers\n ignored@x\n\n");
  ASSERT_EQ(smtp_reject_load(), 0);
  EXPECT_FALSE(smtp_reject_match("boss@corp.example"));
  EXPECT_TRUE(smtp_reject_match("clerk@corp.example"));
  EXPECT_FALSE(smtp_reject_match("ignored@x"));
  EXPECT_FALSE(smtp_reject_match("friend@else.example"));
}

TEST_F(QueueTest, ErrorMailsAreWholeMessagesFromAndNeverToTheNullSender) {
  write_file(in("1"), "MAIL FROM:<ann@far.example>\r\nRCPT TO:<x@site.example>\r\nDATA\r\nSubject: s\r\n\r\nbody\r\n.\r\n");
  config.admin_email = "postmaster";  // completed with the mail domain
  ASSERT_EQ(send_error_mail("Local user x\ndoes not exist\n.dot\n", "", in("1")), ErrorMail::sent);
  ASSERT_EQ(queue_incoming().size(), 1u);
  std::string mail = read_file(queue_incoming().front());
  EXPECT_TRUE(mail.starts_with("MAIL FROM:<>\r\nRCPT TO:<ann@far.example>\r\nDATA\r\n")) << mail;
  EXPECT_NE(mail.find("\r\nFrom: postmaster@site.example\r\n"), std::string::npos);
  EXPECT_NE(mail.find("\r\nX-Loop: 0\r\n\r\nAn error occured whilst trying to send this mail.\r\n"
                      "Local user x\r\ndoes not exist\r\n..dot\r\n"),
            std::string::npos);
  EXPECT_NE(mail.find("    ----- Unsent Message Follows -----\r\n\r\nSubject: s\r\n\r\nbody\r\n.\r\n"),
            std::string::npos);
  EXPECT_TRUE(mail.ends_with("\r\n.\r\n"));
  for (std::size_t i = mail.find('\n'); i != std::string::npos; i = mail.find('\n', i + 1))
    EXPECT_EQ(mail[i - 1], '\r') << "bare LF at " << i;

  // Only the header of a refused message goes back; no file, no attachment.
  EXPECT_EQ(send_error_mail("too big\r\n", "admin@site.example", in("1"), true), ErrorMail::sent);
  mail = read_file(queue_incoming().back());
  EXPECT_TRUE(mail.ends_with("-----\r\n\r\nSubject: s\r\n.\r\n"));
  EXPECT_EQ(mail.find("body"), std::string::npos);
  EXPECT_EQ(send_error_mail("note", "admin@site.example", ""), ErrorMail::sent);
  mail = read_file(queue_incoming().back());
  EXPECT_TRUE(mail.ends_with("\r\nnote\r\n.\r\n"));

  write_file(in("2"), "MAIL FROM:<>\r\nRCPT TO:<x@site.example>\r\nDATA\r\nSubject: s\r\n\r\nbody\r\n.\r\n");
  std::size_t before = queue_incoming().size();
  EXPECT_EQ(send_error_mail("x", "", in("2")), ErrorMail::skipped);
  EXPECT_EQ(queue_incoming().size(), before);
}

TEST_F(QueueTest, AMessageThatLoopsGoesToOddmentsInsteadOfAnotherErrorMail) {
  const std::string looping = "MAIL FROM:<a@far.example>\r\nRCPT TO:<x>\r\nDATA\r\nSubject: s\r\n\r\nx-loop: yes\r\n.\r\n";
  const std::string plain = "MAIL FROM:<a@far.example>\r\nRCPT TO:<x>\r\nDATA\r\nSubject: s\r\n\r\nok\r\n.\r\n";
  write_file(in("1"), looping);
  write_file(in("2"), plain);
  EXPECT_EQ(send_error_mail("x", "", in("1")), ErrorMail::moved);
  EXPECT_TRUE(queue_incoming().empty());
  // Two files moved in the same second keep both.
  mail_move_to_oddments(in("2"), "test");
  std::vector<std::string> odd = folder_names(root + "/odd");
  ASSERT_EQ(odd.size(), 2u);
  std::vector<std::string> kept{read_file(root + "/odd/" + odd[0]), read_file(root + "/odd/" + odd[1])};
  std::sort(kept.begin(), kept.end());
  EXPECT_EQ(kept, (std::vector<std::string>{plain, looping}));
}

TEST_F(QueueTest, BannedPhrasesAreFoundAnywhereInALargeFile) {
  std::string big(3 * 1024 * 1024, 'a');
  big.replace(big.size() - 20, 10, "BuY NoW!!!");
  write_file(in("9"), big);
  EXPECT_TRUE(mail_filter_match("'cheap', 'buy now'", in("9")));
  EXPECT_FALSE(mail_filter_match("'cheap', 'sell now'", in("9")));
  EXPECT_FALSE(mail_filter_match("", in("9")));
}

TEST_F(QueueTest, OutgoingRescanMergesAndKeepsHeldEntries) {
  config.smtp_direct = "direct.example";
  std::string out = root + "/out/";
  write_file(out + "1", "MAIL FROM:<ann@site.example>\r\nRCPT TO:<a@far.example>\r\nRCPT TO:<b@far.example>\r\nDATA\r\nx\r\n.\r\n");
  write_file(out + "2", "MAIL FROM:<ann@site.example>\r\nRCPT TO:<c@direct.example>\r\nDATA\r\nx\r\n.\r\n");
  queue_scan_outgoing();
  ASSERT_EQ(queue_outgoing().size(), 2u);
  const OutgoingEntry& first = queue_outgoing().front();
  EXPECT_EQ(first.sender, "ann@site.example");
  EXPECT_EQ(first.recipients, "a@far.example, b@far.example");
  EXPECT_EQ(first.route, "default");
  EXPECT_EQ(queue_outgoing().back().route, "direct.example");

  const_cast<OutgoingEntry&>(first).holder = 7;  // a connection is sending it
  const OutgoingEntry* held = &first;
  unlink((out + "1").c_str());
  unlink((out + "2").c_str());
  write_file(out + "3", "MAIL FROM:<x@site.example>\r\nRCPT TO:<d@far.example>\r\nDATA\r\nx\r\n.\r\n");
  queue_scan_outgoing();
  ASSERT_EQ(queue_outgoing().size(), 2u);
  EXPECT_EQ(&queue_outgoing().front(), held);  // the same entry, not a copy
  EXPECT_EQ(queue_outgoing().back().path, out + "3");

  std::vector<std::string> lines;
  queue_list([&](std::string_view l) { lines.emplace_back(l); });
  ASSERT_EQ(lines.size(), 8u);
  EXPECT_EQ(lines.front(), "start mq\n");
  EXPECT_EQ(lines[4].substr(24, 30), "x@site.example                ");
  EXPECT_EQ(lines[5], "d@far.example");
  EXPECT_EQ(lines.back(), "end mq\n");
}

}  // namespace
}  // namespace velmor
