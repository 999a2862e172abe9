// HTTP dates: written as IMF-fixdate, read in that form and in the two
// obsolete ones that old clients and servers still send.
#pragma once

#include <ctime>
#include <optional>
#include <string>
#include <string_view>

namespace velmor::http {

// "Sun, 06 Nov 1994 08:49:37 GMT", whatever the locale.
std::string http_date(std::time_t t);

// "Sun, 06 Nov 1994 08:49:37 GMT", "Sunday, 06-Nov-94 08:49:37 GMT" or
// "Sun Nov  6 08:49:37 1994", all in GMT; nullopt for anything else (a
// caller ignores a date it cannot read rather than guess). A two-digit year
// that would lie more than 50 years after `now` is in the century before.
std::optional<std::time_t> parse_http_date(std::string_view text, std::time_t now);

}  // namespace velmor::http
