// URLs: splitting a URI reference into its parts (RFC 3986), the request
// target forms of HTTP, resolving a reference against a base, and escaping.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace velmor::http {

// A URI reference split into its parts. The parts keep their escapes (a
// path's "%2F" is not a "/"); scheme and host are lower-cased. The flags say
// whether a part was there at all ("http://h/?" has an empty query, "http://h/"
// none), so that text() gives the reference back.
struct Url {
  std::string scheme;  // empty in a relative reference
  bool has_authority = false;
  bool has_userinfo = false;
  std::string userinfo;  // "user:password", before the "@"
  std::string host;      // an IPv6 literal without its brackets
  int port = 0;          // 0 when none is written
  std::string path;
  bool has_query = false;
  std::string query;
  bool has_fragment = false;
  std::string fragment;

  // The user and the password of the userinfo, unescaped.
  std::string user() const;
  std::optional<std::string> password() const;
  // The port written, else the scheme's own (http 80, https 443, ftp 21,
  // gopher 70), else 0.
  int effective_port() const;
  // "host" or "host:port", an IPv6 literal in brackets: a Host field's value.
  std::string host_port() const;
  // The path ("/" when empty) and the query: the origin-form of a request.
  std::string target() const;
  // The whole reference again.
  std::string text() const;
  bool operator==(const Url&) const = default;
};

// Any URI reference, absolute or relative; nullopt when it holds a blank or
// control byte, a bad scheme, userinfo, host (or one over 255 characters)
// or port (1 to 65535).
std::optional<Url> parse_url(std::string_view text);

// A request's target: the origin-form ("/path?query"), the absolute-form
// (a scheme and a host, as sent to a proxy), the authority-form of CONNECT
// ("host:port", the port required) or "*" for OPTIONS (the path "*"). No
// form carries a fragment.
std::optional<Url> parse_target(std::string_view target, std::string_view method);

// The target URI of `reference` read against `base` (RFC 3986 5.2).
Url resolve(const Url& base, const Url& reference);
// A path with its "." and ".." segments worked out (RFC 3986 5.2.4).
std::string remove_dot_segments(std::string_view path);

// ---- escaping ----------------------------------------------------------------

enum class DecodeResult { ok, bad_escape, nul };

// In place: "%xx" to its byte and, in form data, "+" to a blank. A "%"
// without two hexadecimal digits stays as it is (bad_escape); nul when a
// NUL byte was decoded (the worse of the two is reported).
DecodeResult url_decode(std::string& text, bool plus_as_blank = true);
// Form data: letters, digits and "/" stay, a blank becomes "+", every other
// byte "%xx" in lower-case hexadecimal. url_decode gives the text back.
std::string url_escape(std::string_view text);
// A path for a Location field or a link: unreserved characters, sub-delims,
// ":", "@" and "/" stay, every other byte becomes "%XX".
std::string path_escape(std::string_view path);

}  // namespace velmor::http
