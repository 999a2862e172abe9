#include "core/telnet.h"

namespace velmor {

std::size_t telnet_strip(std::string_view input, std::string& answers) {
  constexpr unsigned char IAC = 255, WILL = 251, WONT = 252, DONT = 254;  // DO is 253
  std::size_t i = 0;
  while (i < input.size()) {
    const auto c = static_cast<unsigned char>(input[i]);
    if (c == IAC) {
      if (i + 1 >= input.size()) break;  // the rest of the sequence comes later
      const auto verb = static_cast<unsigned char>(input[i + 1]);
      if (verb >= WILL && verb <= DONT) {
        if (i + 2 >= input.size()) break;
        answers += static_cast<char>(IAC);
        answers += static_cast<char>(verb == WILL ? DONT : WONT);
        answers += input[i + 2];
        i += 3;
      } else {
        i += 2;
      }
      continue;
    }
    if ((c >= 1 && c <= 6) || (c >= 14 && c <= 31)) {
      ++i;
      continue;
    }
    break;  // printable, NUL or 7..13: the data begins
  }
  return i;
}

}  // namespace velmor
