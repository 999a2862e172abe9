// Small configuration-style text files (log routing, MIME map, ...), read
// whole through the file cache and walked line by line.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace velmor {

// The whole file, read through the file cache (and dropped from it after);
// nullopt when it cannot be opened.
std::optional<std::string> read_text_file(const std::string& path);

// Calls fn(line) for every line of `text`; lines end at CR or LF, and the
// empty lines that runs of CR and LF make are passed on too.
template <class Fn>
void for_each_line(std::string_view text, Fn fn) {
  while (!text.empty()) {
    std::size_t end = text.find_first_of("\r\n");
    fn(text.substr(0, end));
    if (end == std::string_view::npos) break;
    text.remove_prefix(end + 1);
  }
}

}  // namespace velmor
