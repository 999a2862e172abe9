// The script reader and the substitutions on any script text.
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "dialler/script.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  std::string_view text(reinterpret_cast<const char*>(data), size);
  ScriptValues values;
  values.user = "user";
  values.pass = "x;touch FILE";
  values.phone = "5551234";
  for (ScriptLine line; (line = script_line(text)).length;) {
    if (line.length > text.size()) __builtin_trap();
    if (line.command != 'c' && line.argument.size() > kModemArgumentMax) __builtin_trap();
    auto shell = script_substitute(line.argument, Substitute::shell, values);
    script_substitute(line.argument, Substitute::modem, values);
    script_seconds(line.argument);
    // Only the unsafe password can make a command unsafe.
    if (!shell.unsafe.empty() && shell.unsafe != "%pass") __builtin_trap();
    text.remove_prefix(line.length);
  }
  return 0;
}
