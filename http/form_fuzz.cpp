// Any bytes as form data: the first byte's low bits give the length of a
// multipart boundary taken from the bytes after it, the rest is the body.
// Every part found lies inside the body; urlencoded fields never fail.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "http/form.h"

using namespace velmor::http;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  std::string_view text(reinterpret_cast<const char*>(data + 1), size - 1);
  std::size_t length = std::min<std::size_t>(data[0] % 8 + 1, text.size());
  std::string_view boundary = text.substr(0, length), body = text.substr(length);
  if (auto parts = parse_multipart(body, boundary)) {
    for (const FormPart& part : *parts) {
      if (part.data.data() < body.data() || part.data.data() + part.data.size() > body.data() + body.size())
        std::abort();
    }
  }
  multipart_boundary(text);
  form_fields(text);
  form_value(text, boundary);
  form_text(text);
  return 0;
}
