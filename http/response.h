// Writing a response head: the status line, the fields and the blank line.
// Whatever a field or the reason holds, the head cannot be split (see
// HeaderList::text).
#pragma once

#include <string>
#include <string_view>

#include "http/head.h"

namespace velmor::http {

// The usual phrase of a status code ("Not Found"); "Unknown" for others.
std::string_view reason_phrase(int status);

// "HTTP/1.1 404 Not Found" CR LF (the usual phrase when none is given).
std::string status_line(int status, std::string_view reason = {}, int version = 11);

// The whole head of `response`; nothing for HTTP/0.9, whose answer is the
// body alone.
std::string write_head(const ResponseHead& response);

}  // namespace velmor::http
