#include <sys/resource.h>

#include <csignal>

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
    write_file(root + "/users", "ann,x,Ann," + root + "/home/ann,0\n");
    write_file(root + "/groups", "#0\n%group.name: all\n");
    ASSERT_EQ(user_load(root + "/users"), 0);
    ASSERT_EQ(groups_load(root + "/groups"), 0);
  }

  // Debatches `file` while no file may grow past the inbox's current size.
  void debatch_with_full_disk(const std::string& file) {
    std::string inbox = root + "/home/ann/mail/inbox";
    write_file(inbox, std::string(200000, 'x'));
    std::signal(SIGXFSZ, SIG_IGN);
    rlimit old{}, small{200000, 200000};
    getrlimit(RLIMIT_FSIZE, &old);
    small.rlim_max = old.rlim_max;
    setrlimit(RLIMIT_FSIZE, &small);
    debatch_file(file);
    setrlimit(RLIMIT_FSIZE, &old);
    EXPECT_EQ(read_file(inbox), std::string(200000, 'x'));  // the mailbox as it was
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

TEST_F(DebatchTest, ATemporaryFailureBesideACopyGoesToOddmentsWithItsReason) {
  std::string text =
      std::string("MAIL FROM:<x@far.example>\r\nRCPT TO:<b@far.example>\r\nRCPT TO:<ann@site.example>\r\n") + kMessage;
  std::string file = root + "/in/7";
  write_file(file, text);
  debatch_with_full_disk(file);
  EXPECT_EQ(file_size(file), -1);
  std::vector<std::string> odd = folder_names(root + "/odd", true);
  ASSERT_EQ(odd.size(), 1u);
  EXPECT_EQ(read_file(odd[0]), text);
  ASSERT_EQ(folder_names(root + "/out", true).size(), 1u);  // b still gets it
}

TEST_F(DebatchTest, AFileWithoutRecipientsOrBodyGoesToOddments) {
  write_file(root + "/in/8", std::string("MAIL FROM:<x@far.example>\r\n") + kMessage);
  debatch_file(root + "/in/8");
  write_file(root + "/in/9", "MAIL FROM:<x@far.example>\r\nRCPT TO:<ann@site.example>\r\n");
  debatch_file(root + "/in/9");
  EXPECT_EQ(folder_names(root + "/odd", true).size(), 2u);
  EXPECT_TRUE(folder_names(root + "/in", true).empty());
}

}  // namespace
}  // namespace velmor
