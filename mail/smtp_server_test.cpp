// The SMTP server over loopback: the real service on an ephemeral port, a
// plain client socket, and the dispatcher pumped in between; the file layer's
// seam counts and fails the syncs, renames and writes of the queue commit.
#include <arpa/inet.h>
#include <sys/socket.h>

#include <chrono>

#include "core/sockets.h"
#include "mail/queue_test_fixture.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {
namespace {

class SmtpServerTest : public QueueFixture {
 protected:
  void SetUp() override {
    QueueFixture::SetUp();
    paths.bind_address = "127.0.0.1";
    config.sock_buffer = 16384;
    write_file(root + "/users", "ann,x,Ann," + root + "/ann,0\n");
    write_file(root + "/groups", "#0\n");
    ASSERT_EQ(user_load(root + "/users"), 0);
    ASSERT_EQ(groups_load(root + "/groups"), 0);
    smtp_server_register();
    ASSERT_EQ(listener_open(0, svc::smtp, 6, &listener), 0);
  }
  void TearDown() override {
    sysio::reset();
    sockets_close_all();
    QueueFixture::TearDown();
  }

  std::string connect() {  // the greeting
    sockaddr_in a{};
    socklen_t len = sizeof a;
    getsockname(listener, reinterpret_cast<sockaddr*>(&a), &len);
    client = UniqueFd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    EXPECT_EQ(::connect(client.get(), reinterpret_cast<sockaddr*>(&a), len), 0);
    return say("");
  }
  // Sends `text`; the next reply line, the dispatcher pumped until it comes.
  std::string say(std::string_view text) {
    ::send(client.get(), text.data(), text.size(), 0);
    std::string line;
    auto end = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (line.find('\n') == std::string::npos && std::chrono::steady_clock::now() < end) {
      dispatcher(10);
      char c;
      while (line.find('\n') == std::string::npos && ::recv(client.get(), &c, 1, MSG_DONTWAIT) == 1) line += c;
    }
    return line.substr(0, line.find('\r'));
  }
  std::string send_message() {  // the reply to its end
    say("MAIL FROM:<x@far.example>\r\n");
    say("RCPT TO:<ann@site.example>\r\n");
    say("DATA\r\n");
    return say("Subject: s\r\n\r\nbody\r\n.\r\n");
  }

  int listener = -1;
  UniqueFd client;
};

TEST_F(SmtpServerTest, AMessageIsAcknowledgedOnlyOnceItsFileAndFolderAreSynced) {
  connect();
  sysio::reset();
  EXPECT_EQ(send_message(), "250 OK");
  EXPECT_EQ(sysio::count(sysio::Op::sync), 2u);  // syncfs, then the folder
  EXPECT_EQ(sysio::count(sysio::Op::rename), 1u);
  ASSERT_EQ(folder_names(root + "/in").size(), 1u);
  unlink(folder_names(root + "/in", true).front().c_str());
  // The queue file's write, the syncfs, the rename, the folder sync.
  for (auto [op, n] : {std::pair{sysio::Op::write, 1}, {sysio::Op::sync, 1}, {sysio::Op::rename, 1}, {sysio::Op::sync, 2}}) {
    sysio::reset();
    sysio::fail_nth(op, n);
    EXPECT_EQ(send_message(), "451 Requested action aborted: local error in processing") << int(op) << n;
    EXPECT_EQ(folder_names(root + "/in"), std::vector<std::string>{}) << int(op) << n;
  }
}

TEST_F(SmtpServerTest, IdVerifyRefusesASenderThatIsNoLocalUser) {
  EXPECT_EQ(connect().find("[ID verify]"), std::string::npos);
  say("MAIL FROM:<made_up@site.example>\r\n");
  EXPECT_EQ(say("RCPT TO:<ann@site.example>\r\n"), "250 OK Recipient syntactically correct");
  config.smtp_auth = address_list_parse("127.0.0.1");
  EXPECT_NE(connect().find("SMTP Server [ID verify] (v"), std::string::npos);
  say("MAIL FROM:<made_up@site.example>\r\n");
  EXPECT_EQ(say("RCPT TO:<ann@site.example>\r\n"), "550 posting denied");
  for (const char* real : {"MAIL FROM:<ann@site.example>\r\n", "MAIL FROM:<someone@far.example>\r\n"}) {
    say(real);
    EXPECT_EQ(say("RCPT TO:<ann@site.example>\r\n"), "250 OK Recipient syntactically correct");
  }
}

}  // namespace
}  // namespace velmor
