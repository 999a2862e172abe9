// Any bytes as a URL, a request target and a text to escape: a parsed URL
// written again parses to the same parts, resolving never fails, and every
// escape decodes back to the text.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "http/url.h"

using namespace velmor::http;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view text(reinterpret_cast<const char*>(data), size);
  static const Url base = *parse_url("http://a/b/c/d;p?q");
  if (std::optional<Url> url = parse_url(text)) {
    if (parse_url(url->text()) != url) std::abort();
    resolve(base, *url);
    resolve(*url, base);
  }
  for (const char* method : {"GET", "CONNECT", "OPTIONS"}) {
    std::optional<Url> target = parse_target(text, method);
    if (target && std::string_view(method) == "CONNECT" && (target->host.empty() || target->port == 0)) std::abort();
  }
  std::string form = url_escape(text);
  std::string path = path_escape(text);
  if (url_decode(form) == DecodeResult::bad_escape || form != text) std::abort();
  if (url_decode(path, false) == DecodeResult::bad_escape || path != text) std::abort();
  std::string dots = remove_dot_segments(text);
  if (dots.size() > text.size()) std::abort();
  return 0;
}
