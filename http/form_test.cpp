#include "http/form.h"

#include <gtest/gtest.h>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/test_files.h"
#include "http/url.h"

namespace velmor::http {
namespace {

TEST(FormFields, QueryStrings) {
  const char* q = "/cgi?a=1&Name=J%20D+x&empty=&flag&b=2";
  EXPECT_EQ(form_value(q, "name"), "J D x");
  EXPECT_EQ(form_value(q, "empty"), "");
  EXPECT_EQ(form_value(q, "flag"), std::nullopt);
  EXPECT_EQ(form_value(q, "missing"), std::nullopt);
  EXPECT_EQ(form_value(q, "b"), "2");
  EXPECT_EQ(form_value("x=1&y=2", "y"), "2");  // no "?": the whole text
  EXPECT_EQ(form_value("ya=1&a=2", "a"), "2");  // a field name, not a tail of one
  EXPECT_EQ(form_value("v=" + std::string(600, 'z'), "v")->size(), 510u);
  EXPECT_EQ(form_text("a%20b+c&rest"), "a b c");
  EXPECT_EQ(form_text(std::string(300, 'q')).size(), 254u);
  using Fields = std::vector<std::pair<std::string, std::string>>;
  EXPECT_EQ(form_fields("a=1&&B%26=x+y&flag&=v&c=%3D="),
            (Fields{{"a", "1"}, {"B&", "x y"}, {"flag", ""}, {"", "v"}, {"c", "=="}}));
}

TEST(FormFields, PostedBodiesInFiles) {
  testing_files::ScratchDir scratch;
  paths.tmp_dir = scratch.path().string();
  config.cache_big = 4 * 1024;  // small windows, so values cross them
  ASSERT_EQ(filecache_init(), 0);

  std::string long_value, long_escaped;
  for (int i = 0; i < 20000; ++i) {
    char c = static_cast<char>("a &%\r\n"[i % 6]);
    long_value += c;
    long_escaped += url_escape(std::string(1, c));
  }
  CacheFile body = filecache_open("", FileMode::temporary);
  ASSERT_TRUE(body);
  ASSERT_EQ(filecache_puts(body, "to=a%40b&subject=Hi+there&bad=%zz&text=" + long_escaped + "&end=1"), 0);
  EXPECT_EQ(form_file_offset(body, "to"), 3);
  EXPECT_EQ(form_file_offset(body, "TEXT"), 39);
  EXPECT_EQ(form_file_offset(body, "o"), -1);
  EXPECT_EQ(form_file_value(body, "subject"), "Hi there");
  EXPECT_EQ(form_file_value(body, "bad"), std::nullopt);
  EXPECT_EQ(form_file_value(body, "end"), "1");
  EXPECT_EQ(form_file_value(body, "nothing"), std::nullopt);

  CacheFile copy = filecache_open("", FileMode::temporary);
  ASSERT_EQ(form_file_copy(body, "text", copy), 0);
  std::string got(filecache_length(copy), '\0');
  filecache_read(copy, got.data(), 0, got.size());
  EXPECT_EQ(got, long_value);
  EXPECT_EQ(form_file_copy(body, "nothing", copy), 1);
  filecache_close(body);
  filecache_close(copy);
  config.cache_big = 0;
}

TEST(Multipart, BoundariesAndBodies) {
  EXPECT_EQ(multipart_boundary("multipart/form-data; boundary=AaB03x"), "AaB03x");
  EXPECT_EQ(multipart_boundary("multipart/form-data; boundary=\"a b:c\""), "a b:c");
  EXPECT_EQ(multipart_boundary("multipart/form-data; boundary=" + std::string(71, 'x')), std::nullopt);
  EXPECT_EQ(multipart_boundary("multipart/form-data"), std::nullopt);

  const std::string browser =
      "--AaB03x\r\nContent-Disposition: form-data; name=\"submit-name\"\r\n\r\nLarry\r\n"
      "--AaB03x\r\nContent-Disposition: form-data; name=\"files\"; filename=\"file1.txt\"\r\n"
      "Content-Type: text/plain\r\n\r\n... contents of\r\n--AaB03 file1.txt ...\r\n--AaB03x--\r\n";
  std::optional<std::vector<FormPart>> parts = parse_multipart(browser, "AaB03x");
  ASSERT_TRUE(parts);
  ASSERT_EQ(parts->size(), 2u);
  EXPECT_EQ((*parts)[0].name, "submit-name");
  EXPECT_EQ((*parts)[0].filename, std::nullopt);
  EXPECT_EQ((*parts)[0].data, "Larry");
  EXPECT_EQ((*parts)[1].name, "files");
  EXPECT_EQ((*parts)[1].filename, "file1.txt");
  EXPECT_EQ((*parts)[1].headers.get("content-type"), "text/plain");
  EXPECT_EQ((*parts)[1].data, "... contents of\r\n--AaB03 file1.txt ...");

  struct Case {
    std::string body;
    std::size_t parts;  // 0: malformed
  } cases[] = {
      {"preamble\r\n--b\r\n\r\n\r\n--b \t\r\nX: 1\r\n\r\ntwo\r\n--b--epilogue", 2},  // an empty part; padding
      {"--b\r\n\r\nno end", 0},
      {"--b\r\nX: 1\r\nno blank line\r\n--b--", 0},
      {"--bX\r\n\r\nx\r\n--b--", 0},
      {"no delimiter at all", 0},
      {"--b\r\n\r\n1\r\n--b\r\n\r\n2\r\n--b\r\n\r\n3\r\n--b--", 0},  // over max_parts
  };
  for (const Case& c : cases) {
    std::optional<std::vector<FormPart>> got = parse_multipart(c.body, "b", 2);
    EXPECT_EQ(got ? got->size() : 0u, c.parts) << c.body;
  }
  EXPECT_EQ(parse_multipart(browser, ""), std::nullopt);
}

}  // namespace
}  // namespace velmor::http
