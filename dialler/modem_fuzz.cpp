// Modem replies in any split: lines, the unfinished tail and the dial results.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "dialler/script.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  std::string_view input(reinterpret_cast<const char*>(data), size);
  ModemReplies replies;
  // The first byte of each chunk gives the length of the chunk after it.
  while (!input.empty()) {
    std::size_t n = std::min<std::size_t>(static_cast<unsigned char>(input[0]), input.size() - 1);
    replies.add(input.substr(1, n));
    input.remove_prefix(n + 1);
    while (auto line = replies.next_line()) {
      if (line->empty() || line->find_first_of("\r\n") != std::string::npos) __builtin_trap();
      std::string connect_text;
      if (dial_result(*line, &connect_text) == DialResult::connect && connect_text.size() > 100) __builtin_trap();
      reply_is_ok(*line);
    }
    if (replies.unfinished().size() > ModemReplies::kMax) __builtin_trap();
    if (replies.unfinished().size() > 3) replies.consume_unfinished(3);
  }
  return 0;
}
