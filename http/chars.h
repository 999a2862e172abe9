// Character classes of HTTP and URLs, shared by the parsers of this folder
// (hexadecimal digits are core's hex_digit).
#pragma once

namespace velmor::http {

inline bool is_digit(char c) { return c >= '0' && c <= '9'; }
inline bool is_alpha(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }
inline bool is_blank(char c) { return c == ' ' || c == '\t'; }
// A control byte: what a field value or a URL never holds (HTAB aside).
inline bool is_control(char c) {
  unsigned char u = static_cast<unsigned char>(c);
  return u < 0x20 || u == 0x7f;
}
// A character of a token: method and field names, transfer codings.
inline bool is_tchar(char c) {
  if (is_alpha(c) || is_digit(c)) return true;
  switch (c) {
    case '!': case '#': case '$': case '%': case '&': case '\'': case '*': case '+':
    case '-': case '.': case '^': case '_': case '`': case '|': case '~':
      return true;
    default:
      return false;
  }
}

}  // namespace velmor::http
