// Any text as a log routing file: log_parse never crashes or overflows a
// setting, and replaces what the text before it routed.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "core/log.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmor::log_parse(std::string_view(reinterpret_cast<const char*>(data), size));
  (void)velmor::log_error_channel_path();
  return 0;
}
