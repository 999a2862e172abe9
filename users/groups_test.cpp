#include "users/groups.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <sstream>

#include "core/defaults.h"
#include "core/test_files.h"

namespace velmor {
namespace {

using namespace testing_files;


// A local time: 2026-12-07 is a Monday, 2026-12-12 a Saturday.
std::time_t local(int day, int hour, int minute) {
  std::tm tm{};
  tm.tm_year = 2026 - 1900;
  tm.tm_mon = 11;
  tm.tm_mday = day;
  tm.tm_hour = hour;
  tm.tm_min = minute;
  tm.tm_isdst = -1;
  return std::mktime(&tm);
}

class GroupsTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(scratch_.path().empty());
  }
  void TearDown() override {
    groups_load("");
  }
  std::string file() const { return (dir_ / "groups").string(); }
  void load(const std::string& text) {
    write_file(file(), text);
    ASSERT_EQ(groups_load(file()), 0);
  }
  // Every option of every set in written form, for comparing two lists.
  static std::string dump() {
    std::string out;
    for (const auto& set : group_list()) {
      out += "#" + std::to_string(set->number) + "\n";
      for (std::string_view key : group_option_keys()) {
        out += std::string(key) + (set->has(key) ? "=" : "~") + *group_option(*set, key) + "\n";
      }
    }
    return out;
  }

  ScratchDir scratch_;
  const fs::path& dir_ = scratch_.path();
};

TEST_F(GroupsTest, ReadsEveryKindOfLine) {
  load("| comment\n"
       "%group.name: before any group\n"
       "#0\n"
       "%group.name:   Everyone\n"
       "%MAIL.MSG.SIZE: 100\n"
       "%mail.filter: 'a'\n"
       "   'b'\n"
       "\t'c'\n"
       "%mail.forward:\n"
       "%mail.vacation: off\n"
       "%mail.override: yes\r\n"
       "%no.such.key: x\n"
       "  continued\n"
       "%mail.pop.fetch: Y\n"
       "%mail.block.redirect: \n"
       "# a comment, not a group\n"
       "%news.groups.read: *\n"
       "#5 staff\n"
       "%group.name: Staff\n"
       "%misc.config: yes\n");
  ASSERT_EQ(group_list().size(), 2u);
  auto everyone = group_default();
  ASSERT_NE(everyone, nullptr);
  EXPECT_EQ(everyone->number, 0);
  EXPECT_EQ(everyone->text("group.name"), "Everyone");
  EXPECT_EQ(everyone->size("mail.msg.size"), 102400u);
  EXPECT_EQ(*group_option(*everyone, "mail.msg.size"), "100");
  EXPECT_EQ(everyone->text("mail.filter"), "'a','b','c'");
  EXPECT_TRUE(everyone->flag("mail.forward"));  // an empty value sets a flag
  EXPECT_EQ(everyone->mail_flags, gflag::mail_forward | gflag::mail_override);
  EXPECT_EQ(*group_option(*everyone, "mail.vacation"), "no");
  EXPECT_EQ(everyone->text("mail.pop.fetch"), "Y");
  EXPECT_TRUE(everyone->has("mail.block.redirect"));  // set, though empty
  EXPECT_FALSE(everyone->has("mail.large.redirect"));
  EXPECT_EQ(everyone->text("news.groups.read"), "*");  // the "#" comment kept the group
  EXPECT_FALSE(group_option(*everyone, "no.such.key"));

  auto staff = group_find(5);
  ASSERT_NE(staff, nullptr);
  EXPECT_EQ(staff->text("group.name"), "Staff");
  EXPECT_EQ(staff->misc_flags, gflag::misc_config);
  EXPECT_EQ(staff->size("mail.msg.size"), 0u);
  EXPECT_EQ(group_find(6), nullptr);
}

TEST_F(GroupsTest, SaveAndLoadKeepEveryOption) {
  load("#3\n#-1\n");
  auto& sets = group_list();
  // Every key gets a value of its kind that differs from the default.
  int n = 0;
  for (std::string_view key : group_option_keys()) {
    ++n;
    switch (group_option_kind(key)) {
      case GroupOptionKind::size:
        ASSERT_TRUE(group_option(*sets[0], key, std::to_string(n * 7)));
        break;
      case GroupOptionKind::flag:
        ASSERT_TRUE(group_option(*sets[0], key, n % 2 ? "yes" : "no"));
        ASSERT_TRUE(group_option(*sets[1], key, "yes"));
        break;
      default:
        ASSERT_TRUE(group_option(*sets[0], key, "value " + std::to_string(n) + ", with 'quotes'"));
        break;
    }
  }
  ASSERT_TRUE(group_option(*sets[1], "proxy.spoof", ""));
  ASSERT_TRUE(group_option(*sets[1], "mail.box.size", "99999999999"));  // past 4 GiB
  EXPECT_EQ(sets[1]->size("mail.box.size"), 0xffffffffu);
  const std::string before = dump();

  ASSERT_EQ(groups_save(), 0);
  const std::string saved = read_file(file());
  EXPECT_EQ(saved.substr(0, 23), "#3\n%group.name: value 1");
  EXPECT_EQ(read_file(file() + "~"), "#3\n#-1\n");
  ASSERT_EQ(groups_load(file()), 0);
  EXPECT_EQ(dump(), before);
  ASSERT_EQ(groups_save(), 0);
  EXPECT_EQ(read_file(file()), saved);
}

TEST_F(GroupsTest, RefusesValuesTheFileCannotCarry) {
  load("#0\n%mail.filter: 'a'\n");
  auto& set = *group_list()[0];
  EXPECT_FALSE(group_option(set, "mail.filter", "x\ny"));
  EXPECT_FALSE(group_option(set, "mail.filter", "x\r"));
  EXPECT_FALSE(group_option(set, "mail.filter", std::string("x\0y", 3)));
  EXPECT_FALSE(group_option(set, "unknown.key", "x"));
  EXPECT_EQ(set.text("mail.filter"), "'a'");
  EXPECT_TRUE(group_option(set, "Mail.Filter", "  'b'"));
  EXPECT_EQ(set.text("mail.filter"), "'b'");
}

TEST_F(GroupsTest, ReloadKeepsASetALiveConnectionHolds) {
  load("#0\n%group.name: old\n%mail.pop.fetch: no\n");
  std::shared_ptr<const GroupOptions> held = group_default();
  load("#0\n%group.name: new\n");
  EXPECT_EQ(held->text("group.name"), "old");
  EXPECT_FALSE(held->permits("mail.pop.fetch"));
  EXPECT_EQ(group_default()->text("group.name"), "new");

  // A missing file leaves no default group at all, and no set refuses.
  EXPECT_EQ(groups_load((dir_ / "missing").string()), 1);
  EXPECT_EQ(group_default(), nullptr);
  EXPECT_FALSE(group_permits(group_default(), "mail.pop.fetch"));
  EXPECT_TRUE(group_permits(held, "mail.imap.fetch"));
  EXPECT_EQ(held->text("group.name"), "old");
}

TEST_F(GroupsTest, PermissionRuleAtPinnedTimes) {
  load("#0\n%mail.pop.fetch: yes\n%mail.imap.fetch: no\n%mail.web.fetch: Y\n"
       "%mail.web.send: N\n%news.nntp.read:\n%web.access: 1-5/09:00-17:30\n"
       "%proxy.socks: 0/22:00-23:59, 6/10:00-11:00\n%group.name: yes\n");
  auto set = group_default();
  const std::time_t monday_noon = local(7, 12, 0);
  EXPECT_TRUE(set->permits("mail.pop.fetch", monday_noon));
  EXPECT_FALSE(set->permits("mail.imap.fetch", monday_noon));
  EXPECT_TRUE(set->permits("mail.web.fetch", monday_noon));
  EXPECT_FALSE(set->permits("mail.web.send", monday_noon));
  EXPECT_TRUE(set->permits("news.nntp.read", monday_noon));     // empty
  EXPECT_TRUE(set->permits("news.nntp.post", monday_noon));     // unset
  EXPECT_FALSE(set->permits("group.name", monday_noon));        // not a permission
  EXPECT_FALSE(set->permits("no.such.permission", monday_noon));

  EXPECT_FALSE(set->permits("web.access", local(7, 8, 59)));
  EXPECT_TRUE(set->permits("web.access", local(7, 9, 0)));
  EXPECT_TRUE(set->permits("web.access", local(11, 17, 30)));  // Friday
  EXPECT_FALSE(set->permits("web.access", local(11, 17, 31)));
  EXPECT_FALSE(set->permits("web.access", local(12, 12, 0)));  // Saturday
  EXPECT_FALSE(set->permits("web.access", local(13, 12, 0)));  // Sunday

  EXPECT_TRUE(set->permits("proxy.socks", local(13, 22, 0)));   // Sunday night
  EXPECT_FALSE(set->permits("proxy.socks", local(13, 21, 59)));
  EXPECT_TRUE(set->permits("proxy.socks", local(12, 11, 0)));   // the second window
  EXPECT_FALSE(set->permits("proxy.socks", local(12, 11, 1)));
}

TEST_F(GroupsTest, CopyTakesEveryOptionButTheNumber) {
  load("#0\n%group.name: base\n%mail.msg.size: 5\n%web.cgi: yes\n#9\n");
  group_copy(*group_list()[0], *group_list()[1]);
  EXPECT_EQ(group_list()[1]->number, 9);
  EXPECT_EQ(group_list()[1]->text("group.name"), "base");
  EXPECT_EQ(group_list()[1]->size("mail.msg.size"), 5120u);
  EXPECT_TRUE(group_list()[1]->flag("web.cgi"));
}

TEST_F(GroupsTest, TheShippedGroupsFileGrantsMailToEveryone) {
  std::string_view shipped;
  for (const DefaultFile& f : default_files()) {
    if (f.path == "config/groups") shipped = f.data;
  }
  ASSERT_FALSE(shipped.empty());
  load(std::string(shipped));
  std::istringstream lines{std::string(shipped)};
  for (std::string line; std::getline(lines, line);) {
    if (line.starts_with("%")) {
      EXPECT_TRUE(group_option(*group_default(), line.substr(1, line.find(':') - 1))) << line;
    }
  }
  auto everyone = group_default();
  ASSERT_NE(everyone, nullptr);
  EXPECT_EQ(everyone->number, 0);
  for (const char* key : {"mail.pop.fetch", "mail.imap.fetch", "mail.smtp.send", "mail.web.fetch",
                          "mail.web.send"}) {
    EXPECT_TRUE(everyone->permits(key, local(12, 3, 0))) << key;
  }
  EXPECT_EQ(everyone->size("mail.msg.size"), 10240u * 1024);
  EXPECT_TRUE(everyone->flag("mail.forward"));
  EXPECT_FALSE(everyone->flag("misc.config"));
}

}  // namespace
}  // namespace velmor
