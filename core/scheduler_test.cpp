#include "core/scheduler.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <thread>

#include "core/config.h"
#include "core/globals.h"
#include "core/process.h"
#include "core/test_files.h"

namespace velmor {
namespace {

TEST(FieldMatch, ListsRangesStepsAndSwitches) {
  EXPECT_TRUE(field_match("*", 17));
  EXPECT_TRUE(field_match("*/5", 3));  // a leading "*" matches everything
  EXPECT_FALSE(field_match("#", 0));
  EXPECT_FALSE(field_match("#5", 5));
  EXPECT_FALSE(field_match("", 0));

  EXPECT_TRUE(field_match("0,30", 0));
  EXPECT_TRUE(field_match("0,30", 30));
  EXPECT_FALSE(field_match("0,30", 15));
  EXPECT_TRUE(field_match("5", 5));
  EXPECT_FALSE(field_match("15", 5));

  EXPECT_TRUE(field_match("1-5", 1));
  EXPECT_TRUE(field_match("1-5", 5));
  EXPECT_FALSE(field_match("1-5", 6));
  EXPECT_TRUE(field_match("0-59/15", 45));
  EXPECT_FALSE(field_match("0-59/15", 46));
  EXPECT_TRUE(field_match("10-20/5,33", 33));
  EXPECT_FALSE(field_match("5-1", 3));

  // A step of 0 must not hang; it matches nothing.
  EXPECT_FALSE(field_match("0-59/0", 0));
  EXPECT_FALSE(field_match("0-59/0", 30));
  // Huge numbers do not overflow into a match.
  EXPECT_FALSE(field_match("99999999999999999999", 7));
}

class SchedulerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(scratch_.path().empty());
    config.file_schedule = dir + "/schedule";
  }
  void write_schedule(const std::string& text) {
    std::ofstream(*config.file_schedule) << text;
    ASSERT_EQ(schedule_load(), 0);
  }
  std::string read(const std::string& name) { return testing_files::read_file(dir + "/" + name); }
  // Reaps children until `name` has `lines` lines (or three seconds pass).
  bool wait_lines(const std::string& name, std::size_t lines) {
    for (int i = 0; i < 300; ++i) {
      process_poll();
      std::string t = read(name);
      if (static_cast<std::size_t>(std::count(t.begin(), t.end(), '\n')) >= lines) return true;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return false;
  }
  // A time at second `s` of a minute, 12:00 on Wednesday 1 January 2025 local.
  static std::time_t at(int minute, int second, int mday = 1, int month = 0) {
    std::tm t{};
    t.tm_year = 125;
    t.tm_mon = month;
    t.tm_mday = mday;
    t.tm_hour = 12;
    t.tm_min = minute;
    t.tm_sec = second;
    t.tm_isdst = -1;
    return std::mktime(&t);
  }
  testing_files::ScratchDir scratch_;
  std::string dir = scratch_.path().string();
};

TEST_F(SchedulerTest, TheTaskFileIsReadLineByLine) {
  std::string long_field(40, '1');
  write_schedule(
      "| comment\n"
      " 0 * * * * leading blank: ignored\n"
      "\n"
      "0,30 * * * * mailtransfer\n"
      "5  12\t1-5 # 0-11   echo a  b\r\n"
      "1 2 3 4\n1 2 3 4 5 \n" +
      long_field + " * * * * field too long\n" + "* * * * * " + std::string(300, 'x') + "\n");
  auto& tasks = schedule_tasks();
  ASSERT_EQ(tasks.size(), 2u);
  EXPECT_EQ(tasks[0].mins, "0,30");
  EXPECT_EQ(tasks[0].command, "mailtransfer");
  EXPECT_EQ(tasks[1].wdays, "1-5");
  EXPECT_EQ(tasks[1].mdays, "#");
  EXPECT_EQ(tasks[1].command, "echo a  b");

  ASSERT_EQ(schedule_save(), 0);
  EXPECT_EQ(read("schedule"), "0,30 * * * * mailtransfer\n5 12 1-5 # 0-11 echo a  b\n");
  ASSERT_EQ(schedule_load(), 0);
  EXPECT_EQ(schedule_tasks().size(), 2u);

  config.file_schedule = dir + "/missing";
  EXPECT_EQ(schedule_load(), 0);
  EXPECT_TRUE(schedule_tasks().empty());
}

// Each minute's tasks run once, within the first half of the minute, and a
// shell command's child inherits no descriptor of the suite.
TEST_F(SchedulerTest, ShellTasksRunOncePerMinuteWithoutOurDescriptors) {
  int leaked = ::open("/dev/null", O_RDONLY);  // deliberately not close-on-exec
  ASSERT_GE(leaked, 3);
  std::string d = dir;
  write_schedule("* * * * * ls /proc/self/fd > " + d + "/fds; echo run >> " + d + "/runs\n" +
                 "* * # 1 0 echo jan1 >> " + d + "/days\n" + "* * 3 # 5 echo june >> " + d + "/days\n");
  server_now = at(10, 40);
  schedule_poll();  // second half of the minute: nothing
  server_now = at(11, 5);
  schedule_poll();
  server_now = at(11, 6);
  schedule_poll();  // same minute: not again
  ASSERT_TRUE(wait_lines("runs", 1));
  server_now = at(12, 0);
  schedule_poll();
  ASSERT_TRUE(wait_lines("runs", 2));
  ASSERT_TRUE(wait_lines("days", 2));
  EXPECT_EQ(read("runs"), "run\nrun\n");
  // ls sees its standard descriptors and the directory it is listing.
  EXPECT_EQ(read("fds"), "0\n1\n2\n3\n");
  // Day of month matched (1 January) while the weekday field is off; the
  // June task matched its weekday but not its month.
  EXPECT_EQ(read("days"), "jan1\njan1\n");
  ::close(leaked);
}

TEST(Process, TheExitStatusArrivesWhenTheChildIsReaped) {
  int status = -2;
  ASSERT_GT(run_shell("exit 3", [&](int s) { status = s; }), 0);
  for (int i = 0; i < 300 && status == -2; ++i) {
    process_poll();
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 3);
}

}  // namespace
}  // namespace velmor
