#include "users/users.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <csignal>
#include <cstdlib>
#include <sstream>

#include "core/config.h"
#include "users/groups.h"
#include "core/test_files.h"

namespace velmor {
namespace {

using namespace testing_files;


unsigned mode_of(const fs::path& path) {
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) return 0;
  return st.st_mode & 0777;
}

class UsersTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(scratch_.path().empty());
    config.file_user_changes = (dir_ / "changes").string();
    config.file_user_exec.reset();
  }
  void TearDown() override {
    config.file_user_changes.reset();
    user_load("");
    groups_load("");
  }
  fs::path users_file() const { return dir_ / "users"; }
  std::string changes() const { return read_file(dir_ / "changes"); }
  // Loads a user file with the given lines.
  void load(const std::string& text) {
    write_file(users_file(), text);
    ASSERT_EQ(user_load(users_file().string()), 0);
  }

  ScratchDir scratch_;
  const fs::path& dir_ = scratch_.path();
};

// Hashes made with `openssl passwd -1`.
constexpr const char* kSecretHash = "$1$7d1ZKX5F$d2aGUoNjVu30rj26rho90/";        // secret
constexpr const char* kBlankHash = "$1$lx0omuBq$5dEG8AEfdfUeLe/sxn9BC1";         // "pass word"
constexpr const char* kCommaHash = "$1$12345678$jpmCCWoVmG5qrbTcR4nUg0";         // "longer password with, comma"
constexpr const char* kShortSaltHash = "$1$xy$3P7miAef5gn2ShGTkWpsn1";            // hunter2

TEST_F(UsersTest, ReadsTheFileAsWrittenAndSavesItBackUnchanged) {
  std::string long_name(3000, 'x');
  load(std::string("| a comment\n") + " indented,ignored\n" + "nocomma\n" + "\n" +
       "alice," + kSecretHash + ",Alice Liddell,/home/alice,3\r\n" +
       "bob," + kBlankHash + "\n" +  // only a login and a hash
       "carol," + kCommaHash + "," + long_name + ",/home/carol,-2\n" +
       "dave,,Dave,/home/dave,x\n");
  ASSERT_EQ(user_list().size(), 4u);

  const UserRecord* alice = user_find("alice");
  ASSERT_NE(alice, nullptr);
  EXPECT_EQ(alice->full_name, "Alice Liddell");
  EXPECT_EQ(alice->home, "/home/alice");  // the CR of a CR LF line is not part of it
  EXPECT_EQ(alice->group, 3);
  const UserRecord* bob = user_find("bob");
  ASSERT_NE(bob, nullptr);
  EXPECT_EQ(bob->full_name, "");
  EXPECT_EQ(bob->home, "");
  EXPECT_EQ(bob->group, 0);
  EXPECT_EQ(user_find("carol")->full_name, long_name);  // lines of any length
  EXPECT_EQ(user_find("carol")->group, -2);
  EXPECT_EQ(user_find("dave")->group, 0);
  EXPECT_EQ(user_find("indented"), nullptr);
  EXPECT_EQ(user_find("nocomma"), nullptr);

  std::string before = read_file(users_file());
  ASSERT_EQ(user_save(), 0);
  std::string first = read_file(users_file());
  // The comment lines the file starts with stay; the lines ignored below them do not.
  EXPECT_TRUE(first.starts_with("| a comment\n")) << first;
  EXPECT_EQ(first.find("indented"), std::string::npos) << first;
  EXPECT_EQ(read_file(dir_.string() + "/users~"), before);
  EXPECT_EQ(mode_of(users_file()), 0600u);

  ASSERT_EQ(user_load(users_file().string()), 0);
  ASSERT_EQ(user_save(), 0);
  EXPECT_EQ(read_file(users_file()), first);  // stable: no reordering on each save
  ASSERT_EQ(user_list().size(), 4u);
  EXPECT_EQ(user_find("carol")->full_name, long_name);
  EXPECT_EQ(user_find("alice")->password_hash, kSecretHash);
}

// A NUL byte that found its way into the file is written back, not taken as
// the end of its field (which renamed the user "a\0b" to "a").
TEST_F(UsersTest, ANulByteInTheFileIsSavedBackUnchanged) {
  std::string text("a\0b,hash,Ann\0Lee,/home/a,1\n", 27);
  ASSERT_EQ(users_parse(text), 0);
  EXPECT_EQ(users_text(), text);
}

// The header that explains the file survives every change made through the
// suite (it used to be dropped by the first save).
TEST_F(UsersTest, TheCommentHeaderIsKeptAcrossSaves) {
  const std::string header = "| The user database\r\n|   login,hash,...\n\n| (edit with --adduser)\n";
  load(header + "bob," + kBlankHash + "\n");
  ASSERT_EQ(user_add("ann", "pw", "Ann Lee", "/home/ann", 0), UserChange::done);
  ASSERT_EQ(user_remove("bob"), UserChange::done);
  std::string saved = read_file(users_file());
  EXPECT_TRUE(saved.starts_with(header + "ann,")) << saved;
  ASSERT_EQ(users_parse("| no line end"), 0);
  EXPECT_EQ(users_text(), "| no line end\n");
  // A lone CR ends a line: the user behind it is a user, not header text
  // (which would write it twice, and then once more at every save).
  ASSERT_EQ(users_parse(std::string("| note\rbob,") + kBlankHash + "\n"), 0);
  std::string text = users_text();
  ASSERT_EQ(users_parse(text), 0);
  EXPECT_EQ(users_text(), text);
  EXPECT_EQ(user_list().size(), 1u);
}

TEST_F(UsersTest, FindsByLoginDottedFullNameAndInitials) {
  load(std::string("eve,") + kSecretHash + ",Eve Ray Moss,/home/eve,0\n" +
       "Ann," + kSecretHash + ",Ann Lee,/home/ann,0\n" +
       "nameless," + kSecretHash + ",,/home/x,0\n");
  EXPECT_EQ(user_find("eve")->login, "eve");
  EXPECT_EQ(user_find("EVE")->login, "eve");
  EXPECT_EQ(user_find("ann")->login, "Ann");
  EXPECT_EQ(user_find("eve.ray.moss")->login, "eve");
  EXPECT_EQ(user_find("Eve.Ray.Moss")->login, "eve");
  EXPECT_EQ(user_find("e.r.moss")->login, "eve");
  EXPECT_EQ(user_find("a.lee")->login, "Ann");
  EXPECT_EQ(user_find("ann.lee")->login, "Ann");
  EXPECT_EQ(user_find("ray.moss"), nullptr);
  EXPECT_EQ(user_find("moss"), nullptr);
  EXPECT_EQ(user_find(""), nullptr);  // never the user without a full name
  EXPECT_TRUE(user_exists("A.LEE"));
  EXPECT_EQ(user_home("e.r.moss"), "/home/eve");
  EXPECT_EQ(user_full_name("nobody"), "");
}

TEST_F(UsersTest, ChecksPasswordsAgainstCryptHashes) {
  load(std::string("alice,") + kSecretHash + ",,,0\n" + "bob," + kBlankHash + ",,,0\n" +
       "carol," + kCommaHash + ",,,0\n" + "dan," + kShortSaltHash + ",,,0\n" + "nohash,,,,0\n");
  EXPECT_EQ(user_check_password("alice", "secret"), 0);
  EXPECT_EQ(user_check_password("ALICE", "secret"), 0);
  EXPECT_EQ(user_check_password("bob", "pass word"), 0);
  EXPECT_EQ(user_check_password("carol", "longer password with, comma"), 0);
  EXPECT_EQ(user_check_password("dan", "hunter2"), 0);

  EXPECT_EQ(user_check_password("alice", "Secret"), 2);
  EXPECT_EQ(user_check_password("alice", "secret "), 2);
  EXPECT_EQ(user_check_password("bob", "secret"), 2);
  EXPECT_EQ(user_check_password("alice", ""), 1);
  EXPECT_EQ(user_check_password("nobody", "secret"), 1);
  EXPECT_EQ(user_check_password("nohash", ""), 1);
  EXPECT_EQ(user_check_password("nohash", "anything"), 1);
}

TEST_F(UsersTest, EveryChangeIsSavedAndLogged) {
  load("");
  ASSERT_EQ(user_add("alice", "first", "Alice Liddell", "/home/alice", 1), UserChange::done);
  ASSERT_EQ(user_add("bob", "first", "", "/home/bob", 0), UserChange::done);
  const std::string hash = user_find("alice")->password_hash;
  EXPECT_EQ(hash.substr(0, 3), "$1$");
  EXPECT_EQ(hash.find('$', 3), 8u);  // five salt characters
  EXPECT_NE(hash.substr(3, 5), user_find("bob")->password_hash.substr(3, 5));
  EXPECT_EQ(user_check_password("alice", "first"), 0);

  EXPECT_EQ(user_set_password("ALICE", "second"), UserChange::done);
  EXPECT_EQ(user_set_home("alice", "/srv/alice"), UserChange::done);
  EXPECT_EQ(user_set_name("alice", "Alice L"), UserChange::done);
  EXPECT_EQ(user_set_group("alice", 4), UserChange::done);
  EXPECT_EQ(user_remove("BOB"), UserChange::done);
  EXPECT_EQ(user_set_password("bob", "x"), UserChange::not_found);
  EXPECT_EQ(user_remove("bob"), UserChange::not_found);

  std::string log = changes();
  std::string expected = "add:alice," + hash + ",Alice Liddell,/home/alice,1\n";
  ASSERT_EQ(log.substr(0, expected.size()), expected);
  EXPECT_NE(log.find("\nadd:bob,$1$"), std::string::npos);
  EXPECT_NE(log.find("\npass:alice,second\ndir:alice,/srv/alice\nname:alice,Alice L\n"
                     "group:alice,4\nremove:bob\n"),
            std::string::npos);
  EXPECT_EQ(mode_of(dir_ / "changes"), 0600u);

  // What was saved is what reloads.
  ASSERT_EQ(user_load(users_file().string()), 0);
  ASSERT_EQ(user_list().size(), 1u);
  const UserRecord* alice = user_find("alice");
  EXPECT_EQ(alice->home, "/srv/alice");
  EXPECT_EQ(alice->full_name, "Alice L");
  EXPECT_EQ(alice->group, 4);
  EXPECT_EQ(user_check_password("alice", "second"), 0);
  EXPECT_EQ(user_check_password("alice", "first"), 2);
  EXPECT_EQ(mode_of(users_file()), 0600u);
  EXPECT_EQ(mode_of(dir_.string() + "/users~"), 0600u);
}

TEST_F(UsersTest, RefusesWhatTheFileCannotCarryAndLeavesItUnchanged) {
  load(std::string("alice,") + kSecretHash + ",Alice,/home/alice,0\n");
  ASSERT_EQ(user_save(), 0);
  const std::string before = read_file(users_file());

  EXPECT_EQ(user_add("bob", "pw", "Bob, Jr", "/home/bob", 0), UserChange::bad_field);
  EXPECT_NE(user_last_error().find("comma"), std::string::npos);
  EXPECT_EQ(user_add("bob", "pw", "Bob", "/home/b\nob", 0), UserChange::bad_field);
  EXPECT_EQ(user_add("bob", "pw", "Bob", std::string("/home/b\0b", 9), 0), UserChange::bad_field);
  EXPECT_EQ(user_add("bob", "pw", "Bob", std::string(256, 'h'), 0), UserChange::bad_field);
  EXPECT_EQ(user_add("b,ob", "pw", "", "", 0), UserChange::bad_field);
  EXPECT_EQ(user_add("bo b", "pw", "", "", 0), UserChange::bad_field);
  EXPECT_EQ(user_add("|bob", "pw", "", "", 0), UserChange::bad_field);
  EXPECT_EQ(user_add("", "pw", "", "", 0), UserChange::bad_field);
  EXPECT_EQ(user_add("bob", "pw\nadd:evil,x", "", "", 0), UserChange::bad_field);
  EXPECT_EQ(user_add("Alice", "pw", "", "", 0), UserChange::exists);  // the same user in another case
  EXPECT_EQ(user_set_name("alice", "A, B"), UserChange::bad_field);
  EXPECT_EQ(user_set_home("alice", "/x\r"), UserChange::bad_field);
  EXPECT_EQ(user_set_password("alice", "a\rb"), UserChange::bad_field);

  EXPECT_EQ(read_file(users_file()), before);
  EXPECT_FALSE(fs::exists(dir_ / "changes"));
  EXPECT_EQ(user_list().size(), 1u);
  EXPECT_EQ(user_find("alice")->full_name, "Alice");
  EXPECT_EQ(user_check_password("alice", "secret"), 0);
}

// Every change fails to save under a file-size limit and leaves the table as
// it was (run in a child process).
bool changes_fail_past_limit(std::size_t limit_bytes) {
  std::signal(SIGXFSZ, SIG_IGN);
  rlimit limit{static_cast<rlim_t>(limit_bytes), static_cast<rlim_t>(limit_bytes)};
  if (::setrlimit(RLIMIT_FSIZE, &limit) != 0) return false;
  return user_add("bob", "pw", std::string(500, 'b'), "/home/bob", 0) == UserChange::not_saved &&
         user_find("bob") == nullptr && user_set_name("alice", std::string(500, 'a')) == UserChange::not_saved &&
         user_find("alice")->full_name == "Alice" &&
         user_last_error().find("could not be written") != std::string::npos;
}

TEST_F(UsersTest, AFailedWriteKeepsTheOldFileAndTheTable) {
  load(std::string("alice,") + kSecretHash + ",Alice,/home/alice,0\n");
  const std::string before = read_file(users_file());
  // In a child whose file-size limit is below what the change would write:
  // the write fails, the old file stays and the table is as it was.
  EXPECT_EXIT(std::exit(changes_fail_past_limit(before.size() + 16) ? 0 : 1),
              ::testing::ExitedWithCode(0), "");
  EXPECT_EQ(read_file(users_file()), before);
  EXPECT_FALSE(fs::exists(dir_ / "changes"));
}

TEST_F(UsersTest, GroupOfAUser) {
  write_file(dir_ / "groups", "#0\n%group.name: default\n#5\n%group.name: staff\n");
  load(std::string("alice,") + kSecretHash + ",Alice,/home/alice,5\n" + "bob,x,Bob,/home/bob,7\n");
  // No groups loaded: nobody has a set, so every service refuses.
  EXPECT_EQ(user_group("alice"), nullptr);
  ASSERT_EQ(groups_load((dir_ / "groups").string()), 0);
  EXPECT_EQ(user_group("alice")->text("group.name"), "staff");
  EXPECT_EQ(user_group("ALICE")->number, 5);
  EXPECT_EQ(user_group("bob")->text("group.name"), "default");  // group 7 has no set
  EXPECT_EQ(user_group("stranger")->number, 0);
  EXPECT_EQ(user_group("")->number, 0);
}

TEST(RandomPassword, HasTheAskedLengthAndDiffers) {
  std::string a = random_password(12), b = random_password(12);
  EXPECT_EQ(a.size(), 12u);
  EXPECT_NE(a, b);
  EXPECT_EQ(a.find_first_not_of("abcdefghijkmnpqrstuvwxyzABCDEFGHJKLMNPQRSTUVWXYZ23456789"),
            std::string::npos);
}

}  // namespace
}  // namespace velmor
