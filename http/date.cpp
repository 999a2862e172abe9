#include "http/date.h"

#include "core/strfmt.h"
#include "core/util.h"
#include "http/chars.h"

namespace velmor::http {

namespace {

constexpr std::string_view kDays[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
constexpr std::string_view kLongDays[] = {"Sunday", "Monday", "Tuesday", "Wednesday", "Thursday", "Friday", "Saturday"};
constexpr std::string_view kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                        "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

template <std::size_t N>
int index_of(const std::string_view (&names)[N], std::string_view word) {
  for (std::size_t i = 0; i < N; ++i) {
    if (str_iequals(names[i], word)) return static_cast<int>(i);
  }
  return -1;
}

// Whether the text has the pattern's shape: "d" a digit, "_" a digit or a
// blank, "a" a letter, anything else itself.
bool shaped(std::string_view text, std::string_view pattern) {
  if (text.size() != pattern.size()) return false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    char c = text[i], p = pattern[i];
    bool ok = p == 'd' ? is_digit(c) : p == '_' ? (is_digit(c) || c == ' ') : p == 'a' ? is_alpha(c) : c == p;
    if (!ok) return false;
  }
  return true;
}

int number(std::string_view text, std::size_t at, std::size_t length) {
  int n = 0;
  for (char c : text.substr(at, length)) n = n * 10 + (c == ' ' ? 0 : c - '0');
  return n;
}

// The date from its fields at the given offsets; nullopt when a field is
// out of range (31 Feb, 25 o'clock).
std::optional<std::time_t> assemble(std::string_view text, std::size_t day, std::size_t month, int year,
                                    std::size_t clock) {
  std::tm tm{};
  tm.tm_mday = number(text, day, 2);
  tm.tm_mon = index_of(kMonths, text.substr(month, 3));
  tm.tm_year = year - 1900;
  tm.tm_hour = number(text, clock, 2);
  tm.tm_min = number(text, clock + 3, 2);
  tm.tm_sec = number(text, clock + 6, 2);
  if (tm.tm_mon < 0 || tm.tm_hour > 23 || tm.tm_min > 59 || tm.tm_sec > 60) return std::nullopt;
  const int mday = tm.tm_mday;
  std::time_t t = timegm(&tm);
  if (tm.tm_mday != mday) return std::nullopt;  // timegm moved it into the next month
  return t;
}

}  // namespace

std::string http_date(std::time_t t) {
  std::tm tm{};
  gmtime_r(&t, &tm);
  return strprintf("%s, %02d %s %04d %02d:%02d:%02d GMT", kDays[tm.tm_wday].data(), tm.tm_mday,
                   kMonths[tm.tm_mon].data(), tm.tm_year + 1900, tm.tm_hour, tm.tm_min, tm.tm_sec);
}

std::optional<std::time_t> parse_http_date(std::string_view text, std::time_t now) {
  if (shaped(text, "aaa, dd aaa dddd dd:dd:dd GMT") && index_of(kDays, text.substr(0, 3)) >= 0)
    return assemble(text, 5, 8, number(text, 12, 4), 17);
  if (shaped(text, "aaa aaa _d dd:dd:dd dddd") && index_of(kDays, text.substr(0, 3)) >= 0)
    return assemble(text, 8, 4, number(text, 20, 4), 11);
  std::size_t comma = text.find(',');
  if (comma == std::string_view::npos || index_of(kLongDays, text.substr(0, comma)) < 0) return std::nullopt;
  std::string_view rest = text.substr(comma);
  if (!shaped(rest, ", dd-aaa-dd dd:dd:dd GMT")) return std::nullopt;
  std::tm today{};
  gmtime_r(&now, &today);
  int this_year = today.tm_year + 1900;
  int year = this_year / 100 * 100 + number(rest, 9, 2);
  if (year > this_year + 50) year -= 100;
  return assemble(rest, 2, 5, year, 12);
}

}  // namespace velmor::http
