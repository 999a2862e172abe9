#include "http/url.h"

#include <gtest/gtest.h>

namespace velmor::http {
namespace {

// scheme|userinfo|host|port|path?query#fragment, absent parts left out.
std::string parts(const Url& u) {
  std::string out = u.scheme + "|" + (u.has_userinfo ? u.userinfo : "-") + "|" + (u.has_authority ? u.host : "-") +
                    "|" + std::to_string(u.port) + "|" + u.path;
  if (u.has_query) out += "?" + u.query;
  if (u.has_fragment) out += "#" + u.fragment;
  return out;
}

TEST(Url, SplitsReferencesAndGivesThemBack) {
  const std::string long_host = "http://" + std::string(256, 'h') + "/";
  struct Case {
    const char* text;
    const char* parts;  // nullptr: not a URL
  } cases[] = {
      {"http://user:pw@Host.Example:8080/a/b?c=d#f", "http|user:pw|host.example|8080|/a/b?c=d#f"},
      {"FTP://anonymous@ftp.x.org", "ftp|anonymous|ftp.x.org|0|"},
      {"gopher://g/1/x", "gopher|-|g|0|/1/x"},
      {"https://[::1]:8443/x", "https|-|::1|8443|/x"},
      {"http://h?q=1", "http|-|h|0|?q=1"},
      {"http://h/a@b", "http|-|h|0|/a@b"},
      {"http://h:/", "http|-|h|0|/"},
      {"http://h/?", "http|-|h|0|/?"},
      {"http://exa_mple.com/%7Euser/", "http|-|exa_mple.com|0|/%7Euser/"},
      {"mailto:x@y", "mailto|-|-|0|x@y"},
      {"//g", "|-|g|0|"},
      {"../g;x?y#s", "|-|-|0|../g;x?y#s"},
      {"", "|-|-|0|"},
      {"http://h:0/", nullptr},
      {"http://h:65536/", nullptr},
      {"http://h:80x/", nullptr},
      {"http://a@b@c/", nullptr},
      {"http://[::1/", nullptr},
      {"http://[zz]/", nullptr},
      {"http://[v1.x]/", nullptr},
      {"http://ho st/", nullptr},
      {long_host.c_str(), nullptr},
      {"http://h%zz/", nullptr},
      {"http://u\"@h/", nullptr},
      {"http://h/\x01", nullptr},
      {"1http://h/", nullptr},
      {":x", nullptr},
  };
  for (const Case& c : cases) {
    std::optional<Url> u = parse_url(c.text);
    if (!c.parts) {
      EXPECT_EQ(u, std::nullopt) << c.text;
      continue;
    }
    ASSERT_TRUE(u) << c.text;
    EXPECT_EQ(parts(*u), c.parts) << c.text;
    EXPECT_EQ(parse_url(u->text()), u) << c.text;
  }
  Url u = *parse_url("http://us%40er:p%3Aw@[::1]:8080/a?b");
  EXPECT_EQ(u.user(), "us@er");
  EXPECT_EQ(u.password(), "p:w");
  EXPECT_EQ(u.host_port(), "[::1]:8080");
  EXPECT_EQ(u.target(), "/a?b");
  EXPECT_EQ(parse_url("ftp://anonymous@h")->password(), std::nullopt);
  EXPECT_EQ(parse_url("http://" + std::string(255, 'h'))->host.size(), 255u);
  EXPECT_EQ(parse_url("http://h")->target(), "/");
  EXPECT_EQ(parse_url("ftp://h")->effective_port(), 21);
  EXPECT_EQ(parse_url("gopher://h:7070")->effective_port(), 7070);
  EXPECT_EQ(parse_url("telnet://h")->effective_port(), 0);
}

TEST(Url, RequestTargetForms) {
  struct Case {
    const char* method;
    const char* target;
    const char* parts;  // nullptr: refused
  } cases[] = {
      {"GET", "/p?q", "|-|-|0|/p?q"},
      {"GET", "//x/y", "|-|-|0|//x/y"},  // a path, not a host
      {"GET", "http://h/p", "http|-|h|0|/p"},
      {"GET", "http:///p", nullptr},
      {"GET", "http:/p", nullptr},
      {"GET", "p", nullptr},
      {"GET", "/p#f", nullptr},
      {"GET", "*", nullptr},
      {"OPTIONS", "*", "|-|-|0|*"},
      {"CONNECT", "h:443", "|-|h|443|"},
      {"CONNECT", "[::1]:443", "|-|::1|443|"},
      {"CONNECT", "h", nullptr},
      {"CONNECT", "h:0", nullptr},
      {"CONNECT", "u@h:443", nullptr},
      {"CONNECT", "h:443/x", nullptr},
      {"CONNECT", "/p", nullptr},
  };
  for (const Case& c : cases) {
    std::optional<Url> u = parse_target(c.target, c.method);
    std::string what = std::string(c.method) + " " + c.target;
    EXPECT_EQ(u ? parts(*u) : "refused", c.parts ? c.parts : "refused") << what;
  }
}

TEST(Url, ResolvesTheExamplesOfRfc3986) {
  const Url base = *parse_url("http://a/b/c/d;p?q");
  const std::pair<const char*, const char*> examples[] = {
      // Normal examples.
      {"g:h", "g:h"}, {"g", "http://a/b/c/g"}, {"./g", "http://a/b/c/g"}, {"g/", "http://a/b/c/g/"},
      {"/g", "http://a/g"}, {"//g", "http://g"}, {"?y", "http://a/b/c/d;p?y"}, {"g?y", "http://a/b/c/g?y"},
      {"#s", "http://a/b/c/d;p?q#s"}, {"g#s", "http://a/b/c/g#s"}, {"g?y#s", "http://a/b/c/g?y#s"},
      {";x", "http://a/b/c/;x"}, {"g;x", "http://a/b/c/g;x"}, {"g;x?y#s", "http://a/b/c/g;x?y#s"},
      {"", "http://a/b/c/d;p?q"}, {".", "http://a/b/c/"}, {"./", "http://a/b/c/"}, {"..", "http://a/b/"},
      {"../", "http://a/b/"}, {"../g", "http://a/b/g"}, {"../..", "http://a/"}, {"../../", "http://a/"},
      {"../../g", "http://a/g"},
      // Abnormal examples.
      {"../../../g", "http://a/g"}, {"../../../../g", "http://a/g"}, {"/./g", "http://a/g"},
      {"/../g", "http://a/g"}, {"g.", "http://a/b/c/g."}, {".g", "http://a/b/c/.g"}, {"g..", "http://a/b/c/g.."},
      {"..g", "http://a/b/c/..g"}, {"./../g", "http://a/b/g"}, {"./g/.", "http://a/b/c/g/"},
      {"g/./h", "http://a/b/c/g/h"}, {"g/../h", "http://a/b/c/h"}, {"g;x=1/./y", "http://a/b/c/g;x=1/y"},
      {"g;x=1/../y", "http://a/b/c/y"}, {"g?y/./x", "http://a/b/c/g?y/./x"}, {"g?y/../x", "http://a/b/c/g?y/../x"},
      {"g#s/./x", "http://a/b/c/g#s/./x"}, {"g#s/../x", "http://a/b/c/g#s/../x"}, {"http:g", "http:g"},
  };
  for (const auto& [reference, target] : examples) {
    std::optional<Url> ref = parse_url(reference);
    ASSERT_TRUE(ref) << reference;
    EXPECT_EQ(resolve(base, *ref).text(), target) << reference;
  }
  // A base with a host and no path, and a path that would read as a host.
  EXPECT_EQ(resolve(*parse_url("http://h"), *parse_url("g")).text(), "http://h/g");
  EXPECT_EQ(resolve(*parse_url("a:/b"), *parse_url("..//g")).text(), "a:/.//g");
  EXPECT_EQ(remove_dot_segments("/a/b/../../../c/./d/.."), "/c/");
}

TEST(Url, DecodingAndEscaping) {
  struct Case {
    std::string text;
    bool plus_as_blank;
    std::string decoded;
    DecodeResult result;
  } cases[] = {
      {"a%2Bb+c", true, "a+b c", DecodeResult::ok},
      {"a%2bb+c", false, "a+b+c", DecodeResult::ok},
      {"100%", true, "100%", DecodeResult::bad_escape},
      {"%4", true, "%4", DecodeResult::bad_escape},
      {"%zz%41", true, "%zzA", DecodeResult::bad_escape},
      {"+", true, " ", DecodeResult::ok},
      {"x%00y", true, std::string("x\0y", 3), DecodeResult::nul},
      {"%zz%00", true, std::string("%zz\0", 4), DecodeResult::nul},  // the worse of the two
  };
  for (Case c : cases) {
    std::string text = c.text;
    EXPECT_EQ(url_decode(text, c.plus_as_blank), c.result) << c.text;
    EXPECT_EQ(text, c.decoded) << c.text;
  }
  EXPECT_EQ(url_escape("a b/c?"), "a+b/c%3f");
  EXPECT_EQ(url_escape("\xe9"), "%e9");
  std::string round = "Caf\xe9 & co/?=+%";
  std::string escaped = url_escape(round);
  EXPECT_EQ(url_decode(escaped), DecodeResult::ok);
  EXPECT_EQ(escaped, round);
  EXPECT_EQ(path_escape("/~a b/x:y@z;q=1?#%\r\n\xe9"), "/~a%20b/x:y@z;q=1%3F%23%25%0D%0A%E9");
}

}  // namespace
}  // namespace velmor::http
