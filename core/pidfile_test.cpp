#include "core/pidfile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "core/test_files.h"

namespace velmor {
namespace {

using testing_files::read_file;
using testing_files::ScratchDir;
using testing_files::write_file;
using Claim = PidFile::Claim;

TEST(PidFile, HeldWhileRunningAndGoneAfter) {
  ScratchDir dir;
  const std::string path = dir.path().string() + "/velmor.pid";
  PidFile suite;
  ASSERT_EQ(suite.claim(path), Claim::free);
  ASSERT_EQ(suite.publish(1234), Claim::free);
  EXPECT_EQ(read_file(path), "1234");
  EXPECT_FALSE(std::filesystem::exists(path + ".1234.new"));

  PidFile second;  // another open file: flock() tells them apart
  EXPECT_EQ(second.claim(path), Claim::running);
  suite.remove();
  EXPECT_FALSE(std::filesystem::exists(path));
  EXPECT_EQ(second.claim(path), Claim::free);
}

TEST(PidFile, ADeadInstancesFileIsReplaced) {
  ScratchDir dir;
  const std::string path = dir.path().string() + "/velmor.pid";
  write_file(path, "4711\n");
  PidFile suite;
  ASSERT_EQ(suite.claim(path), Claim::stale);
  EXPECT_EQ(suite.stale_pid(), "4711");
  // While the stale file is ours, a second instance is already refused.
  PidFile second;
  EXPECT_EQ(second.claim(path), Claim::running);
  ASSERT_EQ(suite.publish(99), Claim::stale);
  EXPECT_TRUE(suite.replaced_stale());
  EXPECT_EQ(read_file(path), "99");
  EXPECT_EQ(second.claim(path), Claim::running);
}

TEST(PidFile, TheFirstOfTwoThatFoundNothingWins) {
  ScratchDir dir;
  const std::string path = dir.path().string() + "/velmor.pid";
  PidFile a, b;
  ASSERT_EQ(a.claim(path), Claim::free);
  ASSERT_EQ(b.claim(path), Claim::free);
  ASSERT_EQ(a.publish(1), Claim::free);
  EXPECT_EQ(b.publish(2), Claim::running);
  EXPECT_EQ(read_file(path), "1");
  EXPECT_FALSE(std::filesystem::exists(path + ".2.new"));
}

TEST(PidFile, AFolderDoesNotBlockAndALinkIsRefused) {
  ScratchDir dir;
  const std::string path = dir.path().string() + "/velmor.pid";
  ASSERT_EQ(::mkdir(path.c_str(), 0755), 0);
  PidFile suite;
  EXPECT_EQ(suite.claim(path), Claim::free);
  EXPECT_EQ(suite.publish(5), Claim::failed);  // the suite runs without one
  EXPECT_TRUE(std::filesystem::is_directory(path));
  EXPECT_FALSE(std::filesystem::exists(path + ".5.new"));

  const std::string link = dir.path().string() + "/link.pid";
  ASSERT_EQ(::symlink("/etc/passwd", link.c_str()), 0);
  EXPECT_EQ(suite.claim(link), Claim::failed);
  EXPECT_NE(suite.error().find("symbolic link"), std::string::npos);
}

}  // namespace
}  // namespace velmor
