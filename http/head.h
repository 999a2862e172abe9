// Request and response heads: the start line and the fields up to the blank
// line, parsed from a buffer that grows as bytes arrive. The parser never
// sees a socket: the caller hands it everything buffered since the head
// began, as often as more arrives, and consumes used() bytes once it is
// complete.
//
// Line ends: CR LF, or LF alone (a CR before it is part of the end); a CR
// anywhere else makes the head bad rather than guessing where the line
// ends. Empty lines before a request line are skipped. Obsolete line
// folding is refused in a request and joined with one blank in a response.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "http/headers.h"

namespace velmor::http {

enum class HeadResult { complete, need_more, too_big, bad };

struct HeadLimits {
  std::size_t max_bytes = 32 * 1024;  // the whole head, blank line included
  std::size_t max_fields = 100;
};

struct RequestHead {
  std::string method;  // as sent: methods are case-sensitive
  std::string target;  // the request target, still escaped
  int version = 11;    // 10 * major + minor; 9 for a request line without one
  HeaderList headers;
};

struct ResponseHead {
  int version = 11;
  int status = 200;
  std::string reason;
  HeaderList headers;
};

namespace detail {

// What the request and response parsers share: lines, fields and limits.
class HeadReader {
 public:
  explicit HeadReader(HeadLimits limits, FieldFold fold) : limits_(limits), fold_(fold) {}
  std::size_t used() const { return used_; }
  // Why the head is bad or too big (a short English phrase for the log).
  std::string_view error() const { return error_; }

 protected:
  // Reads the start line (handed to `start`, which says whether it is bad,
  // followed by fields or a head by itself) and then the field lines.
  template <class Start>
  HeadResult read(std::string_view buffered, HeaderList& fields, Start start);
  HeadResult fail(HeadResult result, std::string_view why);

 private:
  HeadLimits limits_;
  FieldFold fold_;
  LineReader lines_{true};
  bool started_ = false;
  HeadResult ended_ = HeadResult::need_more;  // what a finished head stays
  std::size_t used_ = 0;
  std::string_view error_;
};

}  // namespace detail

class RequestParser : public detail::HeadReader {
 public:
  explicit RequestParser(HeadLimits limits = {}) : HeadReader(limits, FieldFold::refuse) {}
  // Reads on from where the last call stopped. A request line without a
  // version (HTTP/0.9: "GET /path") is a complete head by itself.
  HeadResult parse(std::string_view buffered);
  RequestHead head;
};

class ResponseParser : public detail::HeadReader {
 public:
  explicit ResponseParser(HeadLimits limits = {}) : HeadReader(limits, FieldFold::join) {}
  HeadResult parse(std::string_view buffered);
  ResponseHead head;
};

}  // namespace velmor::http
