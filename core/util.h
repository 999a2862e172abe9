// Small shared routines whose exact behaviour the services rely on:
// comparison and search without regard to case, wildcard pattern lists,
// access-time windows, formatting, the date parser, Base64 and uuencode,
// MD5 and the "$1$" crypt. URLs, forms, HTML and HTTP dates are in http/.
// Everything that builds text returns a std::string.
#pragma once

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>

namespace velmor {

// ---- comparison (characters lower-cased in the C locale) ------------------
int str_casecmp(std::string_view a, std::string_view b);                 // -1, 0, 1
int str_ncasecmp(std::string_view a, std::string_view b, std::size_t n);  // first n agree -> 0
bool str_iequals(std::string_view a, std::string_view b);
bool str_istarts_with(std::string_view text, std::string_view prefix);
// Position of the first occurrence of needle in haystack, ignoring case.
std::optional<std::size_t> str_casestr(std::string_view haystack, std::string_view needle);
inline void bits_set(std::uint32_t& word, std::uint32_t mask, bool on) {
  word = on ? (word | mask) : (word & ~mask);
}
std::string str_lower(std::string_view text);

// Pattern list separated by commas, blanks or tabs; "#" one character, "%" a
// run up to the next ".", "*" any run (no backtracking). A lone "*" matches
// everything.
bool wildcard_match(std::string_view subject, std::string_view pattern_list);

// The group options' time-of-week permission value ("yes", "no",
// "1-5/09:00-17:30", ...) at local time `now` (server_now when 0).
bool access_granted(std::string_view value, std::time_t now = 0);
// start/end packed hour*256+minute; equal bounds always match; wraps midnight.
bool time_in_window(const std::tm& local, int start, int end);

// ---- formatting -------------------------------------------------------------
std::string number_text(std::uint64_t n);
std::string size_text(std::uint64_t n);  // "%4d ", "%4dK" or "%4dM"
std::string time_text(std::time_t t);    // "%H:%M:%S, %d %b", local time
// strftime of local time with `format` after its leading white space, or
// "%a, %d %b %Y %H:%M:%S" when the format is empty.
std::string date_text(std::time_t t, std::string_view format = {});
// The classic message for an error number (see the table), else the number.
std::string error_text(int error_number);
inline constexpr std::time_t kBadDate = static_cast<std::time_t>(-1);
// Dates of mail separator lines, headers and news; kBadDate on failure.
// Two-digit years: 00-49 are 20xx, 50-99 are 19xx.
std::time_t parse_date(std::string_view text);

// ---- strings ----------------------------------------------------------------
std::string_view line_cut(std::string_view text);  // up to the first CR or LF
std::string_view trim_blanks(std::string_view text);

// A port written as decimal digits alone (host order), 0 when it is not
// one from 1 to 65535.
int port_number(std::string_view digits);

// ---- encodings ------------------------------------------------------------
// The value of one hexadecimal digit (either case) or Base64 character; -1
// for any other character.
int hex_digit(char c);
int base64_digit(char c);
std::string base64_decode(std::string_view text);
std::string base64_encode(std::string_view data);
std::string uu_encode(std::string_view data);

struct Md5 {
  std::uint32_t state[4];
  std::uint64_t count;  // bytes hashed
  unsigned char buffer[64];
};
void md5_init(Md5& ctx);
void md5_update(Md5& ctx, std::string_view data);
void md5_final(Md5& ctx, unsigned char digest[16]);
std::string md5_hex(std::string_view data);
// The "$1$" MD5-based password hash; `setting` may start with "$1$", its salt
// runs to "$" and at most 8 characters.
std::string md5_crypt(std::string_view password, std::string_view setting);
// Compares two texts in time independent of where they first differ.
bool constant_time_equals(std::string_view a, std::string_view b);

// ---- the user-change hook -----------------------------------------------------
// Appends the line to file.user.changes (mode 0600) and runs file.user.exec.
void user_change_note(std::string_view line);

}  // namespace velmor
