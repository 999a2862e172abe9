// Text made safe to stand in an HTML page, in element content or in a
// quoted attribute value.
#pragma once

#include <string>
#include <string_view>

namespace velmor::http {

// "&", "<", ">", '"' and "'" become entities; every other byte stays.
std::string html_escape(std::string_view text);

}  // namespace velmor::http
