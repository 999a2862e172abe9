// The dial-in entry file.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "dialler/dialin.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  auto entries = velmor::dialin_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  for (const auto& e : entries)
    if (e.driver.empty() || e.driver.size() > 250 || e.script.size() > 250) __builtin_trap();
  return 0;
}
