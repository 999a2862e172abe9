// HTML escaping and HTTP dates.
#include <gtest/gtest.h>

#include "http/date.h"
#include "http/html.h"

namespace velmor::http {
namespace {

TEST(Html, EscapesTheFiveCharacters) {
  EXPECT_EQ(html_escape("<a href=\"x\" title='y'>Tom & Jerry</a>"),
            "&lt;a href=&quot;x&quot; title=&#39;y&#39;&gt;Tom &amp; Jerry&lt;/a&gt;");
  EXPECT_EQ(html_escape("caf\xc3\xa9 &amp;"), "caf\xc3\xa9 &amp;amp;");
}

TEST(HttpDate, TheThreeFormsAndNothingElse) {
  const std::time_t now = 1780272000;    // 1 Jun 2026
  const std::time_t sunday = 784111777;  // Sun, 06 Nov 1994 08:49:37 GMT
  struct Case {
    const char* text;
    std::optional<std::time_t> date;
  } cases[] = {
      {"Sun, 06 Nov 1994 08:49:37 GMT", sunday},
      {"Sunday, 06-Nov-94 08:49:37 GMT", sunday},
      {"Sun Nov  6 08:49:37 1994", sunday},
      {"Sun Nov 06 08:49:37 1994", sunday},
      {"sun, 06 nov 1994 08:49:37 GMT", sunday},
      {"Thu, 29 Feb 2024 23:59:59 GMT", 1709251199},
      // Two-digit years: no more than 50 years ahead of now.
      {"Thursday, 01-Jan-76 00:00:00 GMT", 3345062400},  // 2076
      {"Friday, 01-Jan-77 00:00:00 GMT", 220924800},  // 1977
      {"", std::nullopt},
      {"Sun, 06 Nov 1994 08:49:37 +0000", std::nullopt},
      {"Sun, 6 Nov 1994 08:49:37 GMT", std::nullopt},
      {"Sun, 06 Nov 1994 08:49:37 GMT ", std::nullopt},
      {"Sun, 31 Feb 1994 08:49:37 GMT", std::nullopt},
      {"Sun, 00 Nov 1994 08:49:37 GMT", std::nullopt},
      {"Sun, 06 Nov 1994 24:00:00 GMT", std::nullopt},
      {"Sun, 06 Nov 1994 08:60:00 GMT", std::nullopt},
      {"Xyz, 06 Nov 1994 08:49:37 GMT", std::nullopt},
      {"Sun, 06 Xyz 1994 08:49:37 GMT", std::nullopt},
      {"Funday, 06-Nov-94 08:49:37 GMT", std::nullopt},
      {"Sun Nov  6 08:49:37 94", std::nullopt},
      {"-1", std::nullopt},
  };
  for (const Case& c : cases) EXPECT_EQ(parse_http_date(c.text, now), c.date) << c.text;

  EXPECT_EQ(http_date(sunday), "Sun, 06 Nov 1994 08:49:37 GMT");
  for (std::time_t t : std::initializer_list<std::time_t>{0, sunday, 1709208000, 4102444799})
    EXPECT_EQ(parse_http_date(http_date(t), now), t) << t;
}

}  // namespace
}  // namespace velmor::http
