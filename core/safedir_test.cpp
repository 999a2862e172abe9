#include "core/safedir.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "core/test_files.h"

namespace velmor {
namespace {

namespace fs = std::filesystem;
using testing_files::read_file;
using testing_files::write_file;

TEST(SafeDir, EveryStepIsCheckedAndNoLinkIsFollowed) {
  testing_files::ScratchDir scratch;
  fs::path root = scratch.path(), home = root / "home";
  fs::create_directories(home / "mail");
  write_file(root / "secret", "s");
  write_file(home / "mail" / "inbox", "x");
  fs::create_symlink(root / "secret", home / "link");
  fs::create_directory_symlink(root, home / "dirlink");
  fs::create_hard_link(root / "secret", home / "hard");
  ASSERT_EQ(::mkfifo((home / "fifo").c_str(), 0600), 0);
  SafeDir dir;
  ASSERT_TRUE(SafeDir::open_root(home.string(), dir).ok());
  auto status = [&](std::string_view rel, int flags = O_RDONLY) {
    UniqueFd fd;
    return dir.open_file(rel, flags, fd).status;
  };
  EXPECT_EQ(status("mail/inbox"), SafeStatus::ok);
  EXPECT_EQ(status("link"), SafeStatus::link);
  EXPECT_EQ(status("link", O_RDWR | O_CREAT), SafeStatus::link);
  EXPECT_EQ(status("dirlink/secret"), SafeStatus::link);
  EXPECT_EQ(status("hard", O_RDWR), SafeStatus::hard_linked);
  EXPECT_EQ(status("fifo", O_WRONLY), SafeStatus::wrong_type);  // never waits for a reader
  EXPECT_EQ(status("mail"), SafeStatus::wrong_type);
  EXPECT_EQ(status("../secret"), SafeStatus::failed);
  EXPECT_EQ(status("nothing"), SafeStatus::missing);
  UniqueFd fd;
  SafeResult r = dir.open_file("dirlink/secret", O_RDONLY, fd);
  EXPECT_EQ(safe_describe("/h", r), "/h/dirlink is a symbolic link");

  // A link planted where a temporary file goes is removed, not followed.
  fs::create_symlink(root / "secret", home / "f~");
  EXPECT_EQ(dir.replace_file("f", "new"), 0);
  EXPECT_EQ(read_file(root / "secret"), "s");
  EXPECT_EQ(read_file(home / "f"), "new");
  SafeDir made;
  EXPECT_TRUE(dir.open_dir("a/b", true, made).ok());
  EXPECT_TRUE(fs::is_directory(home / "a" / "b"));

  if (::geteuid() != 0) return;
  // Files of the folder's owner and of the suite are accepted, others not.
  ASSERT_EQ(::chown(home.c_str(), 4242, 4242), 0);
  ASSERT_EQ(::chown((home / "mail" / "inbox").c_str(), 4242, 4242), 0);
  ASSERT_TRUE(SafeDir::open_root(home.string(), dir).ok());
  EXPECT_EQ(status("mail/inbox"), SafeStatus::ok);
  EXPECT_EQ(status("f"), SafeStatus::ok);
  ASSERT_EQ(::chown((home / "mail").c_str(), 4243, 4243), 0);
  EXPECT_EQ(status("mail/inbox"), SafeStatus::foreign);
}

}  // namespace
}  // namespace velmor
