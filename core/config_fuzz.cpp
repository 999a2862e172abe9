// Any text as a master file: config_parse never crashes, and every value it
// sets (read through the query form) comes back the same after the file is
// written through a template that names every key and read again.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "core/config.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  static const std::string template_text = [] {
    std::string t = "| every key\n";
    for (const auto& k : config_keys()) t += std::string("%") + k.name + ":\n";
    return t;
  }();
  config_reset();
  config_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  std::vector<std::optional<std::string>> before;
  for (const auto& k : config_keys()) before.push_back(config_key(k.name));

  std::string saved = config_text(template_text);
  config_reset();
  config_parse(saved);
  std::size_t i = 0;
  for (const auto& k : config_keys()) {
    // An unset string is written as the template has it, here empty.
    const std::optional<std::string>& was = before[i++];
    if (was && config_key(k.name) != was) {
      std::fprintf(stderr, "%s changed on saving: \"%s\" became \"%s\"\n", k.name, was->c_str(),
                   config_key(k.name).value_or("(unset)").c_str());
      std::abort();
    }
  }
  return 0;
}
