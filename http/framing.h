// Where a message's body ends and whether the connection goes on after it,
// decided once from the head, so that no two pieces of the suite can read
// the same bytes as different messages.
#pragma once

#include <cstdint>
#include <string_view>

#include "http/head.h"

namespace velmor::http {

enum class BodyKind {
  none,         // no body: the next message starts right after the head
  length,       // exactly `length` bytes
  chunked,      // chunked transfer coding (ChunkedDecoder finds its end)
  until_close,  // everything until the peer closes (responses only)
};

struct Framing {
  BodyKind body = BodyKind::none;
  std::uint64_t length = 0;
  // The peer asked to keep the connection (1.1 unless "Connection: close",
  // 1.0 only with "Connection: keep-alive") and the body has a known end.
  // A connection goes on only when the request and its response both say so.
  bool keep_alive = false;
  // Why the message cannot be read safely (answer 400, or 502 for a
  // response); empty when it can.
  std::string_view error;
  bool ok() const { return error.empty(); }
};

// A request is bad with both Transfer-Encoding and Content-Length, with a
// transfer coding other than chunked alone, with Transfer-Encoding in
// HTTP/1.0, with Content-Length values that differ or are not numbers, and
// without exactly one Host field in HTTP/1.1 (more than one in any version).
Framing request_framing(const RequestHead& request);

// A response to HEAD or CONNECT (2xx), and a 1xx, 204 or 304, has no body
// whatever its fields say. Transfer-Encoding ending in chunked is chunked
// even beside a Content-Length (the connection then ends after it); other
// codings run until the close; a bad Content-Length makes it bad.
Framing response_framing(const ResponseHead& response, std::string_view request_method);

}  // namespace velmor::http
