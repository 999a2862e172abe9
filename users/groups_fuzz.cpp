// Any text as a groups file: groups_parse never crashes, every permission
// it read can be evaluated, and the saved list reads back as the same list.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>

#include "users/groups.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  groups_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  for (const auto& set : group_list()) {
    for (std::string_view key : group_option_keys()) {
      if (group_option_kind(key) == GroupOptionKind::permission) (void)set->permits(key, 1700000000);
    }
  }
  std::string saved = groups_text();
  groups_parse(saved);
  if (groups_text() != saved) {
    std::fprintf(stderr, "the groups file changed on reading it back:\n%s", saved.c_str());
    std::abort();
  }
  return 0;
}
