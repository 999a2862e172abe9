#include "http/framing.h"

#include <optional>
#include <string>
#include <vector>

#include "core/util.h"
#include "http/chars.h"

namespace velmor::http {

namespace {

constexpr std::uint64_t kMaxLength = std::uint64_t{1} << 62;

bool wants_keep_alive(int version, const HeaderList& fields) {
  if (fields.has_token("Connection", "close")) return false;
  if (version >= 11) return true;
  return version == 10 && fields.has_token("Connection", "keep-alive");
}

// The Content-Length of the fields: nullopt without one; false in `ok` when
// a value is not a number or two values differ ("5, 5" is one length).
std::optional<std::uint64_t> content_length(const HeaderList& fields, bool& ok) {
  ok = true;
  std::optional<std::uint64_t> length;
  for (const Field& f : fields.fields()) {
    if (!str_iequals(f.name, "Content-Length")) continue;
    std::size_t items = 0;
    for_each_list_item(f.value, [&](std::string_view item) {
      ++items;
      std::uint64_t n = 0;
      for (char c : item) {
        if (!is_digit(c) || n > kMaxLength / 10) {
          ok = false;
          return;
        }
        n = n * 10 + static_cast<std::uint64_t>(c - '0');
      }
      if (length && *length != n) ok = false;
      length = n;
    });
    if (items == 0) ok = false;
  }
  return length;
}

std::vector<std::string> codings(const HeaderList& fields) {
  std::vector<std::string> out;
  for (const Field& f : fields.fields()) {
    if (str_iequals(f.name, "Transfer-Encoding"))
      for_each_list_item(f.value, [&](std::string_view item) { out.push_back(str_lower(item)); });
  }
  return out;
}

Framing bad(std::string_view why) {
  Framing f;
  f.error = why;
  return f;
}

}  // namespace

Framing request_framing(const RequestHead& request) {
  const HeaderList& fields = request.headers;
  std::size_t hosts = fields.count("Host");
  if (hosts > 1 || (request.version >= 11 && hosts == 0)) return bad("not one Host field");
  bool length_ok = true;
  std::optional<std::uint64_t> length = content_length(fields, length_ok);
  Framing f;
  f.keep_alive = wants_keep_alive(request.version, fields);
  if (fields.has("Transfer-Encoding")) {
    if (length || !length_ok) return bad("both Transfer-Encoding and Content-Length");
    if (request.version < 11) return bad("Transfer-Encoding before HTTP/1.1");
    if (codings(fields) != std::vector<std::string>{"chunked"}) return bad("a transfer coding other than chunked");
    f.body = BodyKind::chunked;
  } else if (!length_ok) {
    return bad("a bad Content-Length");
  } else if (length && *length > 0) {
    f.body = BodyKind::length;
    f.length = *length;
  }
  return f;
}

Framing response_framing(const ResponseHead& response, std::string_view request_method) {
  const HeaderList& fields = response.headers;
  Framing f;
  f.keep_alive = wants_keep_alive(response.version, fields);
  int status = response.status;
  if (request_method == "HEAD" || (request_method == "CONNECT" && status / 100 == 2) || status / 100 == 1 ||
      status == 204 || status == 304)
    return f;
  bool length_ok = true;
  std::optional<std::uint64_t> length = content_length(fields, length_ok);
  if (fields.has("Transfer-Encoding")) {
    std::vector<std::string> list = codings(fields);
    if (list.empty()) return bad("an empty Transfer-Encoding");
    bool chunked_last = response.version >= 11 && list.back() == "chunked";
    for (std::size_t i = 0; i + 1 < list.size(); ++i) {
      if (list[i] == "chunked") return bad("chunked before another coding");
    }
    f.body = chunked_last ? BodyKind::chunked : BodyKind::until_close;
    // Beside a Content-Length the sender is confused or hostile: this
    // message is read by its chunks and the connection ends after it.
    if (!chunked_last || length || !length_ok) f.keep_alive = false;
  } else if (!length_ok) {
    return bad("a bad Content-Length");
  } else if (length) {
    f.body = *length > 0 ? BodyKind::length : BodyKind::none;
    f.length = *length;
  } else {
    f.body = BodyKind::until_close;
    f.keep_alive = false;
  }
  return f;
}

}  // namespace velmor::http
