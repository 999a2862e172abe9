// Telnet option negotiation at the start of a relayed session (the telnet
// proxy): refused politely and stripped, so what follows is the user's text.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace velmor {

// Walks `input` from its start: IAC WILL x is answered IAC DONT x; IAC WONT,
// DO or DONT x is answered IAC WONT x; IAC and any other byte are dropped, as
// are control characters 1-6 and 14-31. Stops at the first printable byte,
// NUL, or 7-13, and before an unfinished sequence (the rest comes later).
// The answers are appended to `answers`; returns how many bytes to consume.
std::size_t telnet_strip(std::string_view input, std::string& answers);

}  // namespace velmor
