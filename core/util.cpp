// Comparison, patterns, access times, formatting and dates. The encodings
// live in codec.cpp.
#include "core/util.h"

#include <algorithm>
#include <cstring>
#include <vector>

#include "core/globals.h"
#include "core/strfmt.h"

namespace velmor {

namespace {

inline unsigned char lower(char c) {
  unsigned char u = static_cast<unsigned char>(c);
  return (u >= 'A' && u <= 'Z') ? static_cast<unsigned char>(u + ('a' - 'A')) : u;
}
inline bool is_digit(char c) { return c >= '0' && c <= '9'; }
inline bool is_alpha(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
inline bool is_blank(char c) { return c == ' ' || c == '\t'; }
inline bool is_separator(char c) { return c == ',' || is_blank(c); }

// Calls `f` for each item of a list separated by commas, blanks or tabs;
// stops early when `f` returns true, and returns whether one did.
template <class F>
bool any_item(std::string_view list, F f) {
  std::size_t i = 0;
  while (i < list.size()) {
    while (i < list.size() && is_separator(list[i])) ++i;
    std::size_t j = i;
    while (j < list.size() && !is_separator(list[j])) ++j;
    if (j > i && f(list.substr(i, j - i))) return true;
    i = j;
  }
  return false;
}

// Reads a decimal number at `i`; false when there is no digit.
bool read_number(std::string_view s, std::size_t& i, long& out) {
  if (i >= s.size() || !is_digit(s[i])) return false;
  out = 0;
  while (i < s.size() && is_digit(s[i])) {
    if (out < 100000000) out = out * 10 + (s[i] - '0');
    ++i;
  }
  return true;
}

std::tm local_time(std::time_t t) {
  std::tm tm{};
  localtime_r(&t, &tm);
  return tm;
}

std::string format_time(std::time_t t, const char* format) {
  std::tm tm = local_time(t);
  std::vector<char> buf(64);
  for (;;) {
    std::size_t n = std::strftime(buf.data(), buf.size(), format, &tm);
    if (n > 0 || buf.size() > 4096) return std::string(buf.data(), n);
    buf.resize(buf.size() * 4);
  }
}

}  // namespace

int hex_digit(char c) {
  if (is_digit(c)) return c - '0';
  unsigned char l = lower(c);
  return (l >= 'a' && l <= 'f') ? l - 'a' + 10 : -1;
}

// ---- comparison ----------------------------------------------------------------

int str_casecmp(std::string_view a, std::string_view b) {
  std::size_t n = std::min(a.size(), b.size());
  for (std::size_t i = 0; i < n; ++i) {
    unsigned char x = lower(a[i]), y = lower(b[i]);
    if (x != y) return x < y ? -1 : 1;
  }
  return a.size() == b.size() ? 0 : (a.size() < b.size() ? -1 : 1);
}

int str_ncasecmp(std::string_view a, std::string_view b, std::size_t n) {
  return str_casecmp(a.substr(0, std::min(n, a.size())), b.substr(0, std::min(n, b.size())));
}

bool str_iequals(std::string_view a, std::string_view b) { return a.size() == b.size() && str_casecmp(a, b) == 0; }

bool str_istarts_with(std::string_view text, std::string_view prefix) {
  return text.size() >= prefix.size() && str_casecmp(text.substr(0, prefix.size()), prefix) == 0;
}

std::optional<std::size_t> str_casestr(std::string_view haystack, std::string_view needle) {
  if (needle.size() > haystack.size()) return std::nullopt;
  for (std::size_t i = 0; i + needle.size() <= haystack.size(); ++i) {
    if (str_iequals(haystack.substr(i, needle.size()), needle)) return i;
  }
  return std::nullopt;
}

std::string str_lower(std::string_view text) {
  std::string out(text);
  for (char& c : out) c = static_cast<char>(lower(c));
  return out;
}

// ---- patterns ------------------------------------------------------------------

namespace {

// One pattern against the whole subject. "*" tries every length, so
// "*.example.com" also matches "a.b.example.com"; the table of partial
// results keeps that linear in the subject for each pattern character.
bool pattern_match(std::string_view s, std::string_view p) {
  const std::size_t n = s.size();
  // next[i]: the position of the first "." at or after i (n when none).
  std::vector<std::size_t> next_dot(n + 1, n);
  for (std::size_t i = n; i-- > 0;) next_dot[i] = s[i] == '.' ? i : next_dot[i + 1];
  // row[i]: the rest of the pattern (from j on) matches s[i..].
  std::vector<char> row(n + 1, 0), prev(n + 1, 0);
  row[n] = 1;  // the empty pattern matches the empty rest
  for (std::size_t j = p.size(); j-- > 0;) {
    std::swap(row, prev);
    const char c = p[j];
    const bool last = j + 1 == p.size();
    char any_later = 0;
    for (std::size_t i = n + 1; i-- > 0;) {
      char ok = 0;
      if (c == '*') {
        any_later = static_cast<char>(any_later | prev[i]);
        ok = last ? 1 : any_later;
      } else if (c == '%') {
        ok = last ? 1 : prev[next_dot[i]];
      } else if (i < n && (c == '#' || lower(c) == lower(s[i]))) {
        ok = prev[i + 1];
      }
      row[i] = ok;
    }
  }
  return row[0] != 0;
}

}  // namespace

bool wildcard_match(std::string_view subject, std::string_view pattern_list) {
  if (pattern_list == "*") return true;
  return any_item(pattern_list, [&](std::string_view pattern) { return pattern_match(subject, pattern); });
}

// ---- access times ----------------------------------------------------------------

namespace {

// "hh:mm" with any one non-digit between; minutes since midnight.
bool read_clock(std::string_view s, std::size_t& i, long& minutes) {
  long h = 0, m = 0;
  if (!read_number(s, i, h) || i >= s.size() || is_digit(s[i])) return false;
  ++i;
  if (!read_number(s, i, m)) return false;
  minutes = h * 60 + m;
  return true;
}

// One item "d/hh:mm-hh:mm" or "d-e/hh:mm-hh:mm" at the given local time.
bool item_grants(std::string_view item, const std::tm& now) {
  std::size_t i = 0;
  if (item.empty() || !is_digit(item[0])) return false;
  long first = item[0] - '0', last = first;
  i = 1;
  if (i + 1 < item.size() && item[i] == '-' && is_digit(item[i + 1])) {
    last = item[i + 1] - '0';
    i += 2;
  }
  if (i >= item.size() || item[i] != '/') return false;
  ++i;
  long from = 0, to = 0;
  if (!read_clock(item, i, from) || i >= item.size()) return false;
  ++i;  // the one character between start and end
  if (!read_clock(item, i, to)) return false;
  long minute = now.tm_hour * 60 + now.tm_min;
  return now.tm_wday >= first && now.tm_wday <= last && minute >= from && minute <= to;
}

}  // namespace

bool access_granted(std::string_view value, std::time_t now) {
  if (value.empty() || value.find_first_of("Yy") != std::string_view::npos) return true;
  if (value.find_first_of("Nn") != std::string_view::npos) return false;
  const std::tm tm = local_time(now ? now : server_now);
  return any_item(value, [&](std::string_view item) { return item_grants(item, tm); });
}

bool time_in_window(const std::tm& local, int start, int end) {
  if (start == end) return true;
  int minute = local.tm_hour * 60 + local.tm_min;
  int from = (start >> 8) * 60 + (start & 0xff);
  int to = (end >> 8) * 60 + (end & 0xff);
  if (from <= to) return minute >= from && minute <= to;
  return minute >= from || minute <= to;  // across midnight
}

// ---- formatting ---------------------------------------------------------------------

std::string number_text(std::uint64_t n) { return std::to_string(n); }

std::string size_text(std::uint64_t n) {
  if (n <= 9999) return strprintf("%4llu ", static_cast<unsigned long long>(n));
  if (n / 1024 <= 9999) return strprintf("%4lluK", static_cast<unsigned long long>(n / 1024));
  return strprintf("%4lluM", static_cast<unsigned long long>(n / 1024 / 1024));
}

std::string time_text(std::time_t t) { return format_time(t, "%H:%M:%S, %d %b"); }

std::string date_text(std::time_t t, std::string_view format) {
  while (!format.empty() && (is_blank(format.front()) || format.front() == '\r' || format.front() == '\n'))
    format.remove_prefix(1);
  if (format.empty()) return format_time(t, "%a, %d %b %Y %H:%M:%S");
  return format_time(t, std::string(format).c_str());
}

std::string error_text(int error_number) {
  static const std::pair<int, const char*> table[] = {
      {1, "Not owner"},
      {2, "No such file or directory"},
      {3, "No such process"},
      {4, "Interrupted system call"},
      {5, "I/O error"},
      {6, "No such device or address"},
      {7, "Arg list too long"},
      {8, "Exec format error"},
      {9, "Bad file number"},
      {10, "No children"},
      {11, "No more processes"},
      {12, "Not enough core"},
      {13, "Permission denied"},
      {14, "Bad address"},
      {15, "Block device required"},
      {16, "Mount device busy"},
      {17, "File exists"},
      {18, "Cross-device link"},
      {19, "No such device"},
      {20, "Not a director"},
      {21, "Is a directory"},
      {22, "Invalid argument"},
      {23, "File table overflow"},
      {24, "Too many open files"},
      {25, "Not a typewriter"},
      {26, "Text file busy"},
      {27, "File too large"},
      {28, "No space left on device"},
      {29, "Illegal seek"},
      {30, "Read-only file system"},
      {31, "Too many links"},
      {32, "Broken pipe"},
      {35, "Deadlock condition."},
      {36, "File name too long"},
      {37, "No record locks available."},
      {39, "Directory not empty"},
      {40, "Too many levels of symbolic links"},
      {66, "Too many levels of remote in path"},
      {87, "Too many users"},
      {88, "Socket operation on non-socket"},
      {89, "Destination address required"},
      {90, "Message too long"},
      {91, "Protocol wrong type for socket"},
      {92, "Protocol not available"},
      {93, "Protocol not supported"},
      {94, "Socket type not supported"},
      {95, "Operation not supported on socket"},
      {96, "Protocol family not supported"},
      {97, "Address family not supported by protocol family"},
      {98, "Address already in use"},
      {99, "Can't assign requested address"},
      {100, "Network is down"},
      {101, "Network is unreachable"},
      {102, "Network dropped connection on reset"},
      {103, "Software caused connection abort"},
      {104, "Connection reset by peer"},
      {105, "No buffer space available"},
      {106, "Socket is already connected"},
      {107, "Socket is not connected"},
      {108, "Can't send after socket shutdown"},
      {109, "Too many references: can't splice"},
      {110, "Connection timed out"},
      {111, "Connection refused"},
      {112, "Host is down"},
      {113, "No route to host"},
      {114, "Operation already in progress"},
      {115, "Operation now in progress"},
      {116, "Stale NFS file handle"},
      {122, "Disc quota exceeded"},
  };
  for (const auto& [number, text] : table) {
    if (number == error_number) return text;
  }
  return std::to_string(error_number);
}

// ---- dates -----------------------------------------------------------------------------

namespace {

int month_of(std::string_view word) {
  static constexpr std::string_view months = "janfebmaraprmayjunjulaugsepoctnovdec";
  if (word.size() < 3) return -1;
  std::string key = str_lower(word.substr(0, 3));
  std::size_t at = months.find(key);
  return (at == std::string_view::npos || at % 3 != 0) ? -1 : static_cast<int>(at / 3);
}

std::string_view word_at(std::string_view s, std::size_t& i) {
  std::size_t from = i;
  while (i < s.size() && is_alpha(s[i])) ++i;
  return s.substr(from, i - from);
}

void skip(std::string_view s, std::size_t& i, std::string_view chars) {
  while (i < s.size() && chars.find(s[i]) != std::string_view::npos) ++i;
}

bool read_time(std::string_view s, std::size_t& i, std::tm& tm) {
  skip(s, i, " \t");
  long h = 0, m = 0, sec = 0;
  if (!read_number(s, i, h) || i >= s.size() || s[i] != ':') return false;
  ++i;
  if (!read_number(s, i, m)) return false;
  if (i < s.size() && s[i] == ':') {
    ++i;
    if (!read_number(s, i, sec)) return false;
  }
  if (h > 23 || m > 59 || sec > 60) return false;
  tm.tm_hour = static_cast<int>(h);
  tm.tm_min = static_cast<int>(m);
  tm.tm_sec = static_cast<int>(sec);
  return true;
}

// True when a number at i is a time (digits then ":").
bool time_ahead(std::string_view s, std::size_t i) {
  while (i < s.size() && is_digit(s[i])) ++i;
  return i < s.size() && s[i] == ':';
}

int full_year(long year) {
  if (year < 50) return static_cast<int>(2000 + year);
  if (year < 100) return static_cast<int>(1900 + year);
  if (year <= 1000) return static_cast<int>(1900 + year);  // years since 1900
  return static_cast<int>(year);
}

// The zone after the time, in seconds east of Greenwich; nullopt when there
// is none that names an offset (the date is then local time).
std::optional<long> read_zone(std::string_view s, std::size_t i) {
  skip(s, i, " \t");
  if (i < s.size() && (s[i] == '+' || s[i] == '-')) {
    std::size_t j = i + 1;
    long hhmm = 0;
    if (!read_number(s, j, hhmm) || j - i != 5) return std::nullopt;
    long offset = (hhmm / 100) * 3600 + (hhmm % 100) * 60;
    return s[i] == '-' ? -offset : offset;
  }
  std::string zone = str_lower(word_at(s, i));
  static const std::pair<const char*, int> zones[] = {
      {"gmt", 0},  {"ut", 0},   {"utc", 0},  {"z", 0},    {"est", -5}, {"edt", -4},
      {"cst", -6}, {"cdt", -5}, {"mst", -7}, {"mdt", -6}, {"pst", -8}, {"pdt", -7},
  };
  for (const auto& [name, hours] : zones) {
    if (zone == name) return hours * 3600L;
  }
  return std::nullopt;
}

}  // namespace

std::time_t parse_date(std::string_view text) {
  std::size_t i = 0;
  skip(text, i, " \t");
  std::size_t word_start = i;
  std::string_view word = word_at(text, i);
  if (month_of(word) >= 0) {
    i = word_start;  // no weekday: the text starts with the month
  } else {
    while (i < text.size() && !is_alpha(text[i]) && !is_digit(text[i])) ++i;
  }
  if (i >= text.size()) return kBadDate;

  std::tm tm{};
  long day = 0, year = 0;
  if (is_alpha(text[i])) {
    // Month first: "Dec 04 19:20:00 2026" (separator lines, asctime).
    int month = month_of(word_at(text, i));
    if (month < 0) return kBadDate;
    tm.tm_mon = month;
    skip(text, i, " \t-");
    if (!read_number(text, i, day)) return kBadDate;
    skip(text, i, " \t,");
    if (time_ahead(text, i)) {
      if (!read_time(text, i, tm)) return kBadDate;
      skip(text, i, " \t");
      if (!read_number(text, i, year)) return kBadDate;
    } else {
      if (!read_number(text, i, year) || !read_time(text, i, tm)) return kBadDate;
    }
  } else {
    // Day first: "04 Dec 2026 19:20:00 +0100", "06-Nov-94 08:49:37 GMT".
    read_number(text, i, day);
    skip(text, i, " \t-");
    int month = month_of(word_at(text, i));
    if (month < 0) return kBadDate;
    tm.tm_mon = month;
    skip(text, i, " \t-");
    if (!read_number(text, i, year) || !read_time(text, i, tm)) return kBadDate;
  }
  if (day < 1 || day > 31) return kBadDate;
  tm.tm_mday = static_cast<int>(day);
  tm.tm_year = full_year(year) - 1900;
  std::optional<long> zone = read_zone(text, i);
  if (zone) {
    std::time_t t = timegm(&tm);
    return t == kBadDate ? kBadDate : t - *zone;
  }
  tm.tm_isdst = -1;
  return std::mktime(&tm);
}

// ---- strings ----------------------------------------------------------------------------

std::string_view line_cut(std::string_view text) { return text.substr(0, text.find_first_of("\r\n")); }

std::string_view trim_blanks(std::string_view text) {
  std::size_t a = text.find_first_not_of(" \t\r\n");
  if (a == std::string_view::npos) return {};
  std::size_t b = text.find_last_not_of(" \t\r\n");
  return text.substr(a, b - a + 1);
}

// ---- ports -------------------------------------------------------------------------

int port_number(std::string_view digits) {
  if (digits.empty() || digits.size() > 5 || digits.find_first_not_of("0123456789") != std::string_view::npos)
    return 0;
  int value = 0;
  for (char ch : digits) value = value * 10 + (ch - '0');
  return value <= 65535 ? value : 0;
}

}  // namespace velmor
