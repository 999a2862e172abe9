// Any text as a user file: users_parse never crashes, lookups by login and
// full-name forms work on what it read, and the saved table reads back as
// the same table.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

#include "users/users.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  std::string_view text(reinterpret_cast<const char*>(data), size);
  users_parse(text);
  (void)user_find(text.substr(0, text.find_first_of(",\r\n")));
  std::string saved = users_text();
  users_parse(saved);
  if (users_text() != saved) {
    std::fprintf(stderr, "the user file changed on reading it back:\n%s", saved.c_str());
    std::abort();
  }
  return 0;
}
