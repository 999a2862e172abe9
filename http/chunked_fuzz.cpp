// Any bytes as a chunked body: decoded whole and decoded a piece at a time
// the result, the body and the bytes used agree, and a decoded body encoded
// again decodes to the same body and trailers.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "http/chunked.h"

using namespace velmor::http;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return 0;
  const std::size_t piece = data[0] % 7 + 1;
  std::string_view text(reinterpret_cast<const char*>(data + 1), size - 1);
  const ChunkLimits limits{.max_line = 64, .max_trailer_bytes = 256, .max_trailer_fields = 8, .max_body = 1 << 20};

  ChunkedDecoder whole(limits);
  std::string body;
  ChunkStep all = whole.feed(text, &body);

  ChunkedDecoder parts(limits);
  std::string body2, pending;
  std::size_t used = 0;
  ChunkStep step{ChunkResult::need_more, 0};
  for (std::size_t at = 0; at < text.size() && step.result == ChunkResult::need_more; at += piece) {
    pending += text.substr(at, piece);
    step = parts.feed(pending, &body2);
    if (step.used > pending.size()) std::abort();
    pending.erase(0, step.used);
    used += step.used;
  }
  if (step.result != all.result && !(text.empty() && all.result == ChunkResult::need_more)) std::abort();
  if (all.result == ChunkResult::done) {
    if (used != all.used || body2 != body || parts.trailers() != whole.trailers()) std::abort();
    std::string again;
    for (std::size_t at = 0; at < body.size(); at += 100) again += chunk(std::string_view(body).substr(at, 100));
    again += last_chunk(whole.trailers());
    ChunkedDecoder reread;
    std::string body3;
    ChunkResult r = reread.feed(again, &body3).result;
    if (r != ChunkResult::done || body3 != body || reread.trailers() != whole.trailers())
      std::abort();
  }
  return 0;
}
