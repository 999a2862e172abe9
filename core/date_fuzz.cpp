// Any text as a date: parse_date never reads outside its input or crashes.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "core/util.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmor::parse_date(std::string_view(reinterpret_cast<const char*>(data), size));
  return 0;
}
