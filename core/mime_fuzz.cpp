// Any text as a MIME map: mime_map_parse never crashes, nor does any lookup
// in the map it builds (the input's first word serves as name and type).
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "core/mime.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  std::string_view text(reinterpret_cast<const char*>(data), size);
  mime_map_parse(text);
  std::string_view word = text.substr(0, text.find_first_of(" \t\r\n"));
  int filetype = filetype_for_name(word);
  (void)filetype_name_for_name(word);
  (void)mime_type_for_extension(word);
  (void)mime_type_for_filetype(filetype_for_mime_type(word));
  (void)filetype_name_for_filetype(filetype);
  return 0;
}
