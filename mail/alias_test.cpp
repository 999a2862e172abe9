#include "mail/alias.h"

#include <gtest/gtest.h>

#include <map>

namespace velmor {
namespace {

TEST(AliasFile, ParsesTargetsOfEveryKind) {
  AliasEntry e;
  ASSERT_TRUE(alias_parse_line("staff ann, bob@example.org\t[09:00-17:00]desk ,$lists/all #archive/staff !carl",
                               e));
  EXPECT_EQ(e.name, "staff");
  ASSERT_EQ(e.targets.size(), 6u);
  EXPECT_EQ(e.targets[0].kind, AliasKind::local);
  EXPECT_EQ(e.targets[1].kind, AliasKind::remote);
  EXPECT_EQ(e.targets[2].kind, AliasKind::timed);
  EXPECT_EQ(e.targets[3].kind, AliasKind::list);
  EXPECT_EQ(e.targets[4].kind, AliasKind::file);
  EXPECT_EQ(e.targets[4].text, "archive/staff");
  EXPECT_TRUE(e.targets[5].bang);
  EXPECT_EQ(e.targets[5].text, "carl");
  for (const char* ignored : {"# comment", "|old", " indented x", "\tx y", "lonely", ""})
    EXPECT_FALSE(alias_parse_line(ignored, e)) << ignored;
}

TEST(AliasFile, SavedTableReloadsAsItWas) {
  std::string long_target(600, 'x');
  std::string text = "a b,c@d\nlong," + long_target + "@example.org\r\nfile,#out/arch,!$l/ist\n";
  std::vector<AliasEntry> table = alias_parse(text);
  ASSERT_EQ(table.size(), 3u);
  EXPECT_EQ(table[1].targets[0].text.size(), 600u + 12u);
  std::string saved;
  for (const AliasEntry& e : table) saved += alias_entry_text(e);
  EXPECT_EQ(saved, "a,b,c@d\nlong," + long_target + "@example.org\nfile,#out/arch,!$l/ist\n");
  std::vector<AliasEntry> again = alias_parse(saved);
  std::string resaved;
  for (const AliasEntry& e : again) resaved += alias_entry_text(e);
  EXPECT_EQ(resaved, saved);
}

// Records what resolution asks for.
class Recorder : public AliasSink {
 public:
  std::vector<std::string> users{"ann", "bob", "carl"};
  std::map<std::string, std::vector<std::string>> lists;
  std::vector<std::string> local, remote, files;
  int loops = 0;
  int hour = 12;

  std::string local_user(std::string_view a) override {
    if (a.find('@') == std::string_view::npos) return std::string(a);
    if (a.substr(a.find('@') + 1) == "here") return std::string(a.substr(0, a.find('@')));
    return {};
  }
  bool user_exists(std::string_view u) override {
    return std::find(users.begin(), users.end(), u) != users.end();
  }
  bool deliver_local(std::string_view u, std::string_view to) override {
    local.push_back(std::string(u) + ":" + std::string(to));
    return true;
  }
  void deliver_remote(std::string_view a) override { remote.emplace_back(a); }
  bool deliver_file(std::string_view p) override {
    files.emplace_back(p);
    return true;
  }
  bool read_list(std::string_view p, std::vector<std::string>& lines) override {
    auto it = lists.find(std::string(p));
    if (it == lists.end()) return false;
    lines = it->second;
    return true;
  }
  bool deliver_group(int) override { return false; }
  void loop_report() override { ++loops; }
  std::tm local_time() override {
    std::tm t{};
    t.tm_hour = hour;
    return t;
  }
};

TEST(AliasResolve, LocalRemoteListAndFileTargets) {
  auto table = alias_parse(
      "team ann,bob@far.example,$lists/team,#arch/team\n"
      "postmaster ann\n"
      "*@old.example carl\n");
  Recorder r;
  r.lists["$lists/team"] = {"carl@here", "%dave@here", "erin@far.example", "", "zed@here"};
  EXPECT_TRUE(alias_resolve(table, "team", r));
  EXPECT_EQ(r.local, (std::vector<std::string>{"ann:ann", "carl:carl@here"}));
  // "%" forces an outside address; an unknown local line goes out as written.
  EXPECT_EQ(r.remote, (std::vector<std::string>{"bob@far.example", "dave@here", "erin@far.example", "zed@here"}));
  EXPECT_EQ(r.files, (std::vector<std::string>{"arch/team"}));

  Recorder r2;
  EXPECT_TRUE(alias_resolve(table, "POSTMASTER", r2));
  EXPECT_TRUE(alias_resolve(table, "x@old.example", r2));
  EXPECT_EQ(r2.local, (std::vector<std::string>{"ann:ann", "carl:carl"}));
  EXPECT_FALSE(alias_resolve(table, "stranger", r2));
  EXPECT_TRUE(alias_resolve(table, "NoBody", r2));  // swallowed
  EXPECT_EQ(r2.local.size(), 2u);
}

TEST(AliasResolve, TenLevelsResolveAndAnEleventhIsALoop) {
  std::string text;
  for (int i = 1; i < 10; ++i) text += "a" + std::to_string(i) + " a" + std::to_string(i + 1) + "\n";
  text += "a10 ann\n";
  Recorder r;
  EXPECT_TRUE(alias_resolve(alias_parse(text), "a1", r));
  EXPECT_EQ(r.local, (std::vector<std::string>{"ann:ann"}));
  EXPECT_EQ(r.loops, 0);

  Recorder r2;
  alias_resolve(alias_parse("a0 a1\n" + text), "a0", r2);
  EXPECT_EQ(r2.loops, 1);
  EXPECT_TRUE(r2.local.empty());
}

TEST(AliasResolve, FanOutLoopsEndWithOneReport) {
  // Each alias names itself many times: without a bound this is 20^10 steps.
  Recorder r;
  std::string line = "x";
  for (int i = 0; i < 20; ++i) line += " x";
  alias_resolve(alias_parse(line + "\n"), "x", r);
  EXPECT_EQ(r.loops, 1);

  // Ten thousand steps through 700 aliases took seconds when each step
  // scanned the table afresh; each name is now looked up once.
  std::string text = "b0";
  for (int i = 0; i < 100; ++i) text += " n1";
  for (int i = 0; i < 700; ++i) text += "\np" + std::to_string(i) + " x";
  for (int k = 1; k < 5; ++k) {
    text += "\nn" + std::to_string(k);
    for (int i = 0; i < 100; ++i) text += " n" + std::to_string(k + 1);
  }
  Recorder r2;
  alias_resolve(alias_parse(text + "\n"), "b0", r2);
  EXPECT_EQ(r2.loops, 1);
}

TEST(AliasResolve, TimedTargetsFollowTheClock) {
  auto table = alias_parse("desk [09:00-17:00]ann,[22:00-06:00]night@far.example\n");
  Recorder day;
  day.hour = 12;
  EXPECT_TRUE(alias_resolve(table, "desk", day));
  EXPECT_EQ(day.local, (std::vector<std::string>{"ann:ann"}));
  EXPECT_TRUE(day.remote.empty());
  Recorder night;
  night.hour = 23;
  EXPECT_TRUE(alias_resolve(table, "desk", night));
  EXPECT_TRUE(night.local.empty());
  EXPECT_EQ(night.remote, (std::vector<std::string>{"night@far.example"}));
  Recorder evening;
  evening.hour = 19;
  EXPECT_FALSE(alias_resolve(table, "desk", evening));
  // Each number counts modulo 256 however long it is: this window ends at
  // 12:30 (a number past the range of int once read as 11:00 to midnight).
  EXPECT_FALSE(alias_resolve(alias_parse("late [11:00-100000000000000000012:30]ann\n"), "late", night));
}

}  // namespace
}  // namespace velmor
