#include "core/log.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <sstream>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/test_files.h"

namespace velmor {
namespace {

using testing_files::read_file;

bool exists(const std::string& path) { return access(path.c_str(), F_OK) == 0; }

class LogTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(scratch_.path().empty());
    dir_ = scratch_.path().string();
    paths.tmp_dir = dir_ + "/tmp";
    config_reset();
    filecache_init();
    server_now = 1700000000;
    log_mask = logfac::house;
  }
  void TearDown() override {
    log_reset();
    filecache_shutdown();
    config_reset();
  }
  // Writes the log configuration (paths relative to the test folder) and
  // starts the logger on it.
  int init(const std::string& routes) {
    std::string text;
    std::istringstream in(routes);
    for (std::string line; std::getline(in, line);) {
      auto blank = line.find(' ');
      if (!line.empty() && line[0] >= '0' && line[0] <= '9' && blank != std::string::npos)
        line.insert(blank + 1, dir_ + "/");
      text += line + "\n";
    }
    std::ofstream(dir_ + "/logconf") << text;
    config.file_log_master = dir_ + "/logconf";
    return log_init();
  }
  std::string log(const std::string& name) { return read_file(dir_ + "/" + name); }
  testing_files::ScratchDir scratch_;
  std::string dir_;
};

TEST_F(LogTest, RoutesFacilitiesAndMask) {
  ASSERT_EQ(init("| comment\n"
                 "2 logs/old\n"
                 "2 logs/main\n"  // the last line of a channel counts
                 "1 logs/errors 4096\n"
                 "x not a route\n"),
            0);
  EXPECT_STREQ(log_error_channel_path(), (dir_ + "/logs/errors").c_str());
  log_message("x", {}, logfac::smtp);  // facility off: nothing
  log_message("Suite started: ", kVersion);
  log_mask |= logfac::smtp | logfac::dialler;
  log_message("hello", {}, logfac::smtp);
  log_message("odd", {}, logfac::smtp | logfac::dialler);  // no single facility: no prefix
  log_mask |= logfac::silence;
  log_message("silenced");
  std::string text = log("logs/main");
  ASSERT_EQ(std::count(text.begin(), text.end(), '\n'), 3) << text;
  // "%H:%M:%S, %d %b -> " is 20 characters.
  EXPECT_EQ(text.substr(8, 2), ", ");
  EXPECT_EQ(text.substr(16, 4), " -> ");
  EXPECT_EQ(text.substr(20, text.find('\n') - 20), std::string("Suite started: ") + kVersion);
  EXPECT_NE(text.find(" -> SMTP: hello\n"), std::string::npos);
  EXPECT_NE(text.find(" -> odd\n"), std::string::npos);
  EXPECT_FALSE(exists(dir_ + "/logs/old"));

  EXPECT_EQ(log_write("no route", 3), 1);
  // Channel 1 is buffered until flushed; an unbuffered write goes after what
  // was buffered.
  EXPECT_EQ(log_write("first", logchan::errors, kLogNoStamp), 0);
  EXPECT_EQ(log("logs/errors"), "");
  EXPECT_EQ(log_write("second", logchan::errors, kLogNoStamp | kLogUnbuffered), 0);
  EXPECT_EQ(log("logs/errors"), "first\nsecond\n");
  struct stat st {};
  ASSERT_EQ(stat((dir_ + "/logs/errors").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0660u);
}

TEST_F(LogTest, LongLinesBypassTheBufferInOrder) {
  ASSERT_EQ(init("8 logs/mail 256\n"), 0);
  log_write("a", logchan::mail, kLogNoStamp);
  log_write("b", logchan::mail, kLogNoStamp | kLogNoNewline);
  std::string long_line(200, 'L');  // more than 256 - 128
  log_write(long_line, logchan::mail, kLogNoStamp);
  log_write("c", logchan::mail, kLogNoStamp);
  EXPECT_EQ(log("logs/mail"), "a\nb" + long_line + "\n");
  log_flush_all();
  EXPECT_EQ(log("logs/mail"), "a\nb" + long_line + "\nc\n");
}

TEST_F(LogTest, TimedFlush) {
  ASSERT_EQ(init("9 logs/trace 4096 1\n"), 0);  // flush every minute
  log_write("queued", logchan::mail_trace);
  log_poll();  // the first flush is due only after the file's creation time
  EXPECT_EQ(log("logs/trace"), "");
  server_now += 1;
  log_poll();
  EXPECT_NE(log("logs/trace").find("queued"), std::string::npos);
  log_write("later", logchan::mail_trace);
  server_now += 30;
  log_poll();
  EXPECT_EQ(log("logs/trace").find("later"), std::string::npos);
  server_now += 31;
  log_poll();
  EXPECT_NE(log("logs/trace").find("later"), std::string::npos);
}

TEST_F(LogTest, RotationKeepsGenerations) {
  // 1 KB limit, 2 generations; the second line names the same file with other
  // settings, which are ignored.
  ASSERT_EQ(init("12 logs/filter 100 0 1 2\n13 logs/filter 9999 0 0 0\n"), 0);
  std::string chunk(600, 'x');
  for (char c : {'1', '2', '3', '4'}) {
    chunk[0] = c;
    log_write(chunk, logchan::filter, kLogNoStamp);
  }
  // Two writes of 601 bytes outgrow 1024: P -> P1, and again P1 -> P2, P -> P1.
  EXPECT_FALSE(exists(dir_ + "/logs/filter"));
  EXPECT_EQ(log("logs/filter1")[0], '3');
  EXPECT_EQ(log("logs/filter2")[0], '1');
  EXPECT_EQ(log("logs/filter1").size(), 1202u);
  log_write("via the other channel", logchan::dialler, kLogNoStamp);  // unbuffered: 100 < 128
  EXPECT_EQ(log("logs/filter"), "via the other channel\n");
}

TEST_F(LogTest, RotationWithoutGenerationsDeletes) {
  ASSERT_EQ(init("12 logs/filter 100 0 1\n"), 0);
  log_write(std::string(1100, 'x'), logchan::filter, kLogNoStamp);
  EXPECT_FALSE(exists(dir_ + "/logs/filter"));
  EXPECT_FALSE(exists(dir_ + "/logs/filter1"));
}

TEST_F(LogTest, HeaderSummary) {
  ASSERT_EQ(init("8 logs/mail\n"), 0);
  log_header_summary("42 192.0.2.9",
                     "Received: from x\r\nfrom: a@b\r\nTO: c@d\r\nSubject: hi\r\nsubject: lower\r\n"
                     "Message-Id: <1@b>\r\nX-Long: y\r\nTo: " +
                         std::string(400, 'z') + "\r\n\r\nFrom: body line\r\n");
  log_flush_all();
  std::string text = log("logs/mail");
  EXPECT_NE(text.find("42 192.0.2.9 - from: a@b\n"), std::string::npos);
  EXPECT_NE(text.find("42 192.0.2.9 - TO: c@d\n"), std::string::npos);
  EXPECT_NE(text.find("42 192.0.2.9 - Subject: hi\n"), std::string::npos);
  EXPECT_NE(text.find("42 192.0.2.9 - Message-Id: <1@b>\n"), std::string::npos);
  EXPECT_EQ(text.find("lower"), std::string::npos);
  EXPECT_EQ(text.find("body line"), std::string::npos);
  EXPECT_NE(text.find("42 192.0.2.9 - To: " + std::string(254 - 19, 'z') + "\n"), std::string::npos);
  EXPECT_EQ(std::count(text.begin(), text.end(), '\n'), 5);  // a time stamp on each line
  EXPECT_EQ(text.find("\n42"), std::string::npos) << text;
}

TEST_F(LogTest, MissingConfiguration) {
  config.file_log_master = dir_ + "/absent";
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(log_init(), 1);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), "couldn't open log config file:'" + dir_ + "/absent'\n");
  EXPECT_EQ(log_error_channel_path(), nullptr);
}

}  // namespace
}  // namespace velmor
