#include "core/mime.h"

#include <gtest/gtest.h>

#include <fstream>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/test_files.h"

namespace velmor {
namespace {

class MimeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(scratch_.path().empty());
    dir_ = scratch_.path().string();
    paths.tmp_dir = dir_ + "/tmp";
    config_reset();
    filecache_init();
    std::ofstream(dir_ + "/mimemap") << "| comment\n"
                                        "text/html\thtml\tfaf\t.html .htm\r\n"
                                        "\n"
                                        "text/x-c  c  fff9  .h .c\n"
                                        "image/gif gif 695 .gif\n"
                                        "text/plain text fff\n"  // no extensions
                                        "broken-line\n"
                                        "text/html\tsecond\t123\t.shtml\n";
    config.file_mimetypes = dir_ + "/mimemap";
    ASSERT_EQ(mime_map_load(), 0);
  }
  void TearDown() override {
    mime_map_clear();
    filecache_shutdown();
    config_reset();
  }
  testing_files::ScratchDir scratch_;
  std::string dir_;
};

TEST_F(MimeTest, Lookups) {
  EXPECT_EQ(mime_type_for_extension(".html"), "text/html");
  EXPECT_EQ(mime_type_for_extension("HTM"), "text/html");
  // Extensions match whole: ".h" is C, not HTML.
  EXPECT_EQ(mime_type_for_extension(".h"), "text/x-c");
  EXPECT_EQ(mime_type_for_extension("tml"), "application/octet-stream");
  EXPECT_EQ(mime_type_for_extension(""), "application/octet-stream");

  EXPECT_EQ(mime_type_for_filetype(kFiletypeHtml), "text/html");
  EXPECT_EQ(mime_type_for_filetype(0x695), "image/gif");
  EXPECT_EQ(mime_type_for_filetype(12345), "application/octet-stream");

  EXPECT_EQ(filetype_for_mime_type("TEXT/HTML"), kFiletypeHtml);  // first entry wins
  EXPECT_EQ(filetype_for_mime_type("text/plain"), 0xfff);
  EXPECT_EQ(filetype_for_mime_type("text/htm"), kFiletypeData);

  EXPECT_EQ(filetype_for_name("/pub/Index.HTML"), kFiletypeHtml);
  EXPECT_EQ(filetype_for_name("main.c"), 0xfff9);
  EXPECT_EQ(filetype_for_name("page.shtml"), 0x123);
  EXPECT_EQ(filetype_for_name("README"), kFiletypeData);
  EXPECT_EQ(filetype_name_for_name("a.gif"), "gif");
  EXPECT_EQ(filetype_name_for_name("a.gif.bak"), "data");
  EXPECT_EQ(filetype_name_for_filetype(0xfff), "text");
  EXPECT_EQ(filetype_name_for_filetype(7), "data");
}

TEST_F(MimeTest, ReloadReplacesAndMissingFileGivesDefaults) {
  ASSERT_EQ(mime_map_load(), 0);
  EXPECT_EQ(filetype_for_mime_type("image/gif"), 0x695);
  config.file_mimetypes = dir_ + "/absent";
  EXPECT_EQ(mime_map_load(), 1);
  EXPECT_EQ(mime_type_for_extension(".html"), "application/octet-stream");
  EXPECT_EQ(filetype_name_for_name("x.gif"), "data");
}

}  // namespace
}  // namespace velmor
