#include "core/util.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>

#include <gtest/gtest.h>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/process.h"
#include "core/test_files.h"

namespace velmor {
namespace {

std::tm fields(int year, int month, int day, int hour, int minute, int second) {
  std::tm tm{};
  tm.tm_year = year - 1900;
  tm.tm_mon = month - 1;
  tm.tm_mday = day;
  tm.tm_hour = hour;
  tm.tm_min = minute;
  tm.tm_sec = second;
  tm.tm_isdst = -1;
  return tm;
}
std::time_t local(int year, int month, int day, int hour, int minute, int second = 0) {
  std::tm tm = fields(year, month, day, hour, minute, second);
  return std::mktime(&tm);
}
std::time_t utc(int year, int month, int day, int hour, int minute, int second = 0) {
  std::tm tm = fields(year, month, day, hour, minute, second);
  return timegm(&tm);
}

TEST(Compare, IgnoresCaseInTheCLocale) {
  EXPECT_EQ(str_casecmp("Hello", "hELLO"), 0);
  EXPECT_EQ(str_casecmp("abc", "ABD"), -1);
  EXPECT_EQ(str_casecmp("abd", "ABC"), 1);
  EXPECT_EQ(str_casecmp("ab", "abc"), -1);
  EXPECT_EQ(str_ncasecmp("abcdef", "ABCxyz", 3), 0);
  EXPECT_NE(str_ncasecmp("ab", "abc", 3), 0);
  EXPECT_TRUE(str_istarts_with("Content-Type: x", "content-type:"));
  EXPECT_FALSE(str_istarts_with("Con", "content"));
  EXPECT_EQ(str_casestr("aab", "ab"), 1u);
  EXPECT_EQ(str_casestr("xxBANNED phrase", "banned"), 2u);
  EXPECT_EQ(str_casestr("short", "longer needle"), std::nullopt);
  EXPECT_EQ(str_lower("MiXeD-1"), "mixed-1");
  std::uint32_t word = 0x10;
  bits_set(word, 0x3, true);
  bits_set(word, 0x10, false);
  EXPECT_EQ(word, 0x3u);
}

TEST(Wildcard, PatternListsAndAwkwardSubjects) {
  EXPECT_TRUE(wildcard_match("news.example", "*.example"));
  EXPECT_TRUE(wildcard_match("mail.example", "%.example"));
  EXPECT_FALSE(wildcard_match("a.b.example", "%.example"));
  EXPECT_TRUE(wildcard_match("abc", "a#c"));
  EXPECT_FALSE(wildcard_match("ac", "a#c"));
  EXPECT_TRUE(wildcard_match("ABC", "abc, xyz"));
  EXPECT_TRUE(wildcard_match("xyz", " ,abc,,\t xyz  "));
  EXPECT_FALSE(wildcard_match("abcd", "abc, xyz"));  // the whole subject must match
  EXPECT_TRUE(wildcard_match("anything at all", "*"));
  EXPECT_FALSE(wildcard_match("x", ""));
  EXPECT_FALSE(wildcard_match("", "a"));
  EXPECT_TRUE(wildcard_match("", "*"));
  // "*" finds the occurrence that lets the rest match, not just the first.
  EXPECT_TRUE(wildcard_match("www.mail.example.com", "*.example.com"));
  EXPECT_TRUE(wildcard_match("banana", "*a"));
  EXPECT_TRUE(wildcard_match("comp.lang.c", "comp.*"));
  EXPECT_TRUE(wildcard_match("comp.lang.c", "comp.%.c"));
  EXPECT_FALSE(wildcard_match("comp.lang.cxx.misc", "comp.%.c"));
  EXPECT_TRUE(wildcard_match("alt.binaries.x", "alt.%"));  // "%" at the end takes the rest
  EXPECT_TRUE(wildcard_match("a.b", "#*#"));
  // A long subject against several stars stays quick.
  EXPECT_FALSE(wildcard_match(std::string(5000, 'a'), "*a*a*a*a*a*a*b"));
}

TEST(AccessTimes, WeekdaysAndWindows) {
  const std::time_t wednesday_0900 = local(2026, 12, 2, 9, 0);
  const std::time_t wednesday_1730 = local(2026, 12, 2, 17, 30);
  const std::time_t wednesday_1731 = local(2026, 12, 2, 17, 31);
  const std::time_t saturday_1000 = local(2026, 12, 5, 10, 0);
  EXPECT_FALSE(access_granted("no", wednesday_0900));
  EXPECT_TRUE(access_granted("", wednesday_0900));
  EXPECT_TRUE(access_granted("Yes", wednesday_0900));
  EXPECT_TRUE(access_granted("1-5/09:00-17:30", wednesday_0900));
  EXPECT_TRUE(access_granted("1-5/09:00-17:30", wednesday_1730));
  EXPECT_FALSE(access_granted("1-5/09:00-17:30", wednesday_1731));
  EXPECT_FALSE(access_granted("1-5/09:00-17:30", saturday_1000));
  EXPECT_TRUE(access_granted("1-5/09:00-17:30, 6/09.30~12.00", saturday_1000));
  EXPECT_FALSE(access_granted("3", wednesday_0900));  // an item without "/" grants nothing
  EXPECT_FALSE(access_granted("3/09", wednesday_0900));
  server_now = saturday_1000;
  EXPECT_TRUE(access_granted("6/10:00-10:00"));

  std::tm tm{};
  auto at = [&](int h, int m) -> const std::tm& {
    tm.tm_hour = h;
    tm.tm_min = m;
    return tm;
  };
  EXPECT_TRUE(time_in_window(at(23, 15), time_of_day(22, 0), time_of_day(6, 0)));
  EXPECT_TRUE(time_in_window(at(5, 59), time_of_day(22, 0), time_of_day(6, 0)));
  EXPECT_FALSE(time_in_window(at(12, 0), time_of_day(22, 0), time_of_day(6, 0)));
  EXPECT_TRUE(time_in_window(at(12, 0), time_of_day(8, 0), time_of_day(8, 0)));
  EXPECT_TRUE(time_in_window(at(18, 0), time_of_day(9, 0), time_of_day(18, 0)));
  EXPECT_FALSE(time_in_window(at(18, 1), time_of_day(9, 0), time_of_day(18, 0)));
}

TEST(Formatting, SizesTimesAndErrors) {
  EXPECT_EQ(size_text(10240), "  10K");
  EXPECT_EQ(size_text(9999), "9999 ");
  EXPECT_EQ(size_text(0), "   0 ");
  EXPECT_EQ(size_text(10 * 1024 * 1024), "  10M");
  EXPECT_EQ(size_text(20000ull * 1024 * 1024), "20000M");
  EXPECT_EQ(number_text(4294967296ull), "4294967296");
  const std::time_t t = local(2026, 12, 4, 19, 20, 5);
  EXPECT_EQ(time_text(t), "19:20:05, 04 Dec");
  EXPECT_EQ(date_text(t), "Fri, 04 Dec 2026 19:20:05");
  EXPECT_EQ(date_text(t, "  %Y-%m-%d"), "2026-12-04");
  EXPECT_EQ(error_text(20), "Not a director");
  EXPECT_EQ(error_text(28), "No space left on device");
  EXPECT_EQ(error_text(35), "Deadlock condition.");
  EXPECT_EQ(error_text(999), "999");
}

TEST(ParseDate, MailNewsAndWebForms) {
  // Mail headers, with zones.
  EXPECT_EQ(parse_date("Thu, 04 Dec 2026 19:20:00 +0100"), utc(2026, 12, 4, 18, 20));
  EXPECT_EQ(parse_date("Tue, 1 Jul 2003 10:52:37 +0200 (CEST)"), utc(2003, 7, 1, 8, 52, 37));
  EXPECT_EQ(parse_date("4 Dec 2026 19:20 -0500"), utc(2026, 12, 5, 0, 20));
  EXPECT_EQ(parse_date("  Fri, 04 Dec 26 19:20:00 EST"), utc(2026, 12, 5, 0, 20));
  // HTTP: RFC 1123, RFC 850 and asctime.
  EXPECT_EQ(parse_date("Sun, 06 Nov 1994 08:49:37 GMT"), 784111777);
  EXPECT_EQ(parse_date("Sunday, 06-Nov-94 08:49:37 GMT"), 784111777);
  EXPECT_EQ(parse_date("Sun Nov  6 08:49:37 1994"), local(1994, 11, 6, 8, 49, 37));
  // Mailbox separator lines are local time.
  EXPECT_EQ(parse_date("Thu Dec 04 19:20:00 2026"), local(2026, 12, 4, 19, 20));
  EXPECT_EQ(parse_date("Dec 04 19:20:00 2026"), local(2026, 12, 4, 19, 20));
  EXPECT_EQ(parse_date("04-Dec-2026 19:20:00"), local(2026, 12, 4, 19, 20));
  // Two-digit years around the century.
  EXPECT_EQ(parse_date("06 Nov 49 08:49:37 GMT"), utc(2049, 11, 6, 8, 49, 37));
  EXPECT_EQ(parse_date("06 Nov 50 08:49:37 GMT"), utc(1950, 11, 6, 8, 49, 37));
  EXPECT_EQ(parse_date("06 Nov 00 08:49:37 GMT"), utc(2000, 11, 6, 8, 49, 37));
  // Not dates.
  for (const char* bad : {"", "   ", "garbage", "here on", "Thu Foo 04 19:20:00 2026", "04 Dec 2026 1920",
                          "32 Dec 2026 10:00:00", "04 Dec 2026 25:00:00", "Dec", "04 Dec", "Thu, 04 Dec 2026"}) {
    EXPECT_EQ(parse_date(bad), kBadDate) << bad;
  }
}

TEST(Strings, LinesBlanksAndPorts) {
  EXPECT_EQ(line_cut("one\r\ntwo"), "one");
  EXPECT_EQ(trim_blanks(" \t x y \r\n"), "x y");
  // Ports are 1-65535 in decimal digits alone.
  for (const char* bad : {"", "0", "65536", "99999999999999", "80x", "+80", " 80"})
    EXPECT_EQ(port_number(bad), 0) << bad;
  EXPECT_EQ(port_number("65535"), 65535);
  EXPECT_EQ(port_number("00080"), 80);
}

TEST(UserChangeNote, AppendsPrivatelyAndRunsTheHook) {
  testing_files::ScratchDir scratch;
  const std::string dir = scratch.path().string();
  const char* tmpl = dir.c_str();
  // A stand-in for the command the hook runs, found on the PATH.
  const std::string script = dir + "/Filer_Run";
  FILE* f = std::fopen(script.c_str(), "w");
  ASSERT_NE(f, nullptr);
  std::fprintf(f, "#!/bin/sh\necho \"$@\" > %s/ran.new && mv %s/ran.new %s/ran\n", tmpl, tmpl, tmpl);
  std::fclose(f);
  ::chmod(script.c_str(), 0755);
  const std::string old_path = std::getenv("PATH") ? std::getenv("PATH") : "";
  ::setenv("PATH", (dir + ":" + old_path).c_str(), 1);

  config.file_user_changes = dir + "/changes";
  user_change_note("add fred");
  config.file_user_exec = "hook";
  user_change_note("change\r\nbob");
  std::string ran = dir + "/ran";
  for (int i = 0; i < 500 && !file_is_regular(ran); ++i) {
    process_poll();
    ::usleep(10000);
  }
  process_poll();
  CacheFile changes = filecache_open(dir + "/changes", FileMode::read);
  EXPECT_EQ(filecache_view(changes, 0), "add fred\nchange  bob\n");
  filecache_close(changes);
  struct stat st{};
  ASSERT_EQ(::stat((dir + "/changes").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  CacheFile out = filecache_open(ran, FileMode::read);
  EXPECT_EQ(filecache_view(out, 0), "hook " + dir + "/changes\n");
  filecache_close(out);

  ::setenv("PATH", old_path.c_str(), 1);
  config.file_user_changes.reset();
  config.file_user_exec.reset();
}

}  // namespace
}  // namespace velmor
