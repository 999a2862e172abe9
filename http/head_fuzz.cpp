// Any bytes as a request head and as a response head: read whole and read in
// two pieces the parser gives the same answer, a complete head decides its
// framing, and a head written again from what was read reads back the same;
// the request's field values are read as dates too.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "http/date.h"
#include "http/framing.h"
#include "http/head.h"
#include "http/response.h"

using namespace velmor::http;

namespace {

template <class Parser>
void check(std::string_view text, std::size_t split, Parser& whole) {
  HeadResult r = whole.parse(text);
  Parser pieces;
  HeadResult first = pieces.parse(text.substr(0, split));
  // A head complete or bad in the first piece is so whole too.
  HeadResult second = first == HeadResult::need_more ? pieces.parse(text) : first;
  if (second != r) std::abort();
  if (r == HeadResult::complete && pieces.used() != whole.used()) std::abort();
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  std::string_view text(reinterpret_cast<const char*>(data), size);
  std::size_t split = size ? data[0] % size : 0;

  RequestParser request;
  check(text, split, request);
  if (request.parse(text) == HeadResult::complete) {
    request_framing(request.head);
    const RequestHead& h = request.head;
    // Field values as dates: one that reads is written back the same.
    for (const Field& f : h.headers.fields()) {
      std::optional<std::time_t> t = parse_http_date(f.value, 1780000000);
      if (t && parse_http_date(http_date(*t), 1780000000) != t) std::abort();
    }
    if (h.version >= 10) {
      std::string again = h.method + " " + h.target + " HTTP/" + std::to_string(h.version / 10) + "." +
                          std::to_string(h.version % 10) + "\r\n" + h.headers.text() + "\r\n";
      RequestParser reread;
      if (reread.parse(again) != HeadResult::complete || reread.head.headers != h.headers ||
          reread.head.target != h.target || reread.head.method != h.method)
        std::abort();
    }
  }

  ResponseParser response;
  check(text, split, response);
  if (response.parse(text) == HeadResult::complete && response.head.version >= 10) {
    response_framing(response.head, "GET");
    ResponseParser reread;
    HeadResult again = reread.parse(write_head(response.head));
    if (again != HeadResult::complete || reread.head.headers != response.head.headers ||
        reread.head.status != response.head.status ||
        (!response.head.reason.empty() && reread.head.reason != response.head.reason))
      std::abort();
  }
  return 0;
}
