// Any bytes as a header value, a body in a transfer encoding and a charset:
// decoding never fails, a body decodes the same whatever pieces it comes
// in, and folded text folds to itself.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "mail/mime_text.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace velmor;
  if (size < 2) return 0;
  std::string_view in(reinterpret_cast<const char*>(data) + 2, size - 2);
  const auto kind = static_cast<TransferDecoder::Kind>(data[0] % 3);
  const std::size_t piece = data[1] % 17 + 1;

  std::string whole, pieces;
  TransferDecoder one(kind), many(kind);
  one.feed(in, whole);
  one.finish(whole);
  for (std::size_t at = 0; at < in.size(); at += piece) many.feed(in.substr(at, piece), pieces);
  many.finish(pieces);
  if (whole != pieces) std::abort();

  std::string decoded = header_words_decode(in);
  std::string folded = utf8_fold(decoded);
  if (utf8_fold(folded) != folded) std::abort();

  std::string converted;
  charset_to_utf8(in.substr(0, in.find('?')), whole, converted);
  return 0;
}
