#include "core/commands.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "core/globals.h"
#include "core/hooks.h"

namespace velmor {
namespace {

class CommandsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    hooks = SuiteHooks{};
    mail_transfer_state = 0;
    link_up = 0;
    server_now = 1000;
    auto note = [this](const char* what) { return [this, what] { calls.push_back(what); }; };
    hooks.dial = note("dial");
    hooks.disconnect = note("disconnect");
    hooks.popkick = [this] {
      calls.push_back("popkick");
      return started;
    };
    hooks.smtpkick = [this] {
      calls.push_back("smtpkick");
      return started;
    };
    hooks.newskick = note("newskick");
    hooks.mailrescan = note("mailrescan");
    hooks.maildebatch = note("maildebatch");
    hooks.newsdebatch = note("newsdebatch");
    hooks.pop_client_count = [this] { return pop_clients; };
    hooks.smtp_client_count = [this] { return smtp_clients; };
  }
  void TearDown() override {
    hooks = SuiteHooks{};
    mail_transfer_state = 0;
    link_up = 0;
  }
  std::vector<std::string> calls;
  bool started = true;  // what the kicks report
  int pop_clients = 0;
  int smtp_clients = 0;
};

TEST_F(CommandsTest, WordsReachTheirSubsystems) {
  for (const char* word : {"POPKICK", "smtpkick", "NewsKick", "mailrescan", "maildebatch", "newsdebatch",
                           "disconnect"})
    EXPECT_EQ(internal_command(word), 1) << word;
  EXPECT_EQ(calls, (std::vector<std::string>{"popkick", "smtpkick", "newskick", "mailrescan", "maildebatch",
                                             "newsdebatch", "disconnect"}));
  EXPECT_EQ(internal_command("smtp"), 0);
  EXPECT_EQ(internal_command("connect now"), 0);

  mail_transfer_state = 3;
  calls.clear();
  EXPECT_EQ(internal_command("Connect"), 1);
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls, std::vector<std::string>{"dial"});
  EXPECT_EQ(internal_command("mailtransfer"), 1);
  EXPECT_EQ(mail_transfer_state, 4);

  // A subsystem that is not running has no hook: the word is still known.
  hooks = SuiteHooks{};
  EXPECT_EQ(internal_command("newskick"), 1);
}

TEST_F(CommandsTest, TransferWithTheLinkUpStartsAtOnce) {
  link_up = 1;
  internal_command("mailtransfer");
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls, (std::vector<std::string>{"popkick", "smtpkick"}));
}

TEST_F(CommandsTest, DialUpTransferRunsToTheEnd) {
  internal_command("mailtransfer");
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 1);
  mail_transfer_poll();  // dialling: the resolver proves the link
  EXPECT_EQ(mail_transfer_state, 1);
  mail_transfer_state = 5;
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 2);
  mail_transfer_poll();  // the clients have not connected yet
  EXPECT_EQ(mail_transfer_state, 2);
  smtp_clients = 1;
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 3);
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 3);
  smtp_clients = 0;
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls, (std::vector<std::string>{"dial", "popkick", "smtpkick", "disconnect"}));
}

TEST_F(CommandsTest, TransferWithNothingToDoHangsUp) {
  // Kicks that started nothing: nothing to wait for.
  started = false;
  mail_transfer_state = 5;
  mail_transfer_poll();
  mail_transfer_poll();
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls, (std::vector<std::string>{"popkick", "smtpkick", "disconnect"}));

  // A kick that reported a connection which never shows up: the grace.
  started = true;
  mail_transfer_state = 5;
  mail_transfer_poll();
  server_now += 59;
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 2);
  server_now += 1;
  mail_transfer_poll();
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls.back(), "disconnect");

  // A connection counted from its kick on and over before the next poll
  // (a fast server): no grace either.
  hooks.popkick = [this] {
    pop_clients = 1;
    return true;
  };
  mail_transfer_state = 5;
  mail_transfer_poll();
  pop_clients = 0;
  mail_transfer_poll();
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);

  // Without the mail clients nothing can start: no grace.
  hooks.popkick = hooks.smtpkick = nullptr;
  mail_transfer_state = 5;
  mail_transfer_poll();
  mail_transfer_poll();
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
}

TEST_F(CommandsTest, TransferWaitingForTheLinkGivesUp) {
  bool dialling = true;
  hooks.dialler_busy = [&dialling] { return dialling; };
  internal_command("mailtransfer");
  mail_transfer_poll();
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 1);
  dialling = false;  // the dial failed
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls, std::vector<std::string>{"dial"});

  // Dialling for ever: ten minutes, then idle and hung up.
  dialling = true;
  calls.clear();
  internal_command("mailtransfer");
  mail_transfer_poll();
  server_now += 599;
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 1);
  server_now += 1;
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 0);
  EXPECT_EQ(calls, (std::vector<std::string>{"dial", "disconnect"}));
  // A later request dials again.
  internal_command("mailtransfer");
  mail_transfer_poll();
  EXPECT_EQ(mail_transfer_state, 1);
}

}  // namespace
}  // namespace velmor
