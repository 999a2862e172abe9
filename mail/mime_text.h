// Mail text as people read it: header words decoded from their encoded
// form ("=?UTF-8?B?...?="), bodies decoded from base64 or quoted-printable,
// everything converted to UTF-8 and folded to one case, so that what a
// person types finds what they were sent.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace velmor {

// Small letters for capitals of ASCII, Latin-1, Latin Extended-A, Greek and
// Cyrillic; other characters, and bytes that are not UTF-8, pass unchanged.
void utf8_fold_append(std::string& out, std::string_view text);
std::string utf8_fold(std::string_view text);

// `text` in `charset` appended as UTF-8 (iconv). Bytes that do not convert
// become U+FFFD; a charset that is unknown (or named oddly) passes the bytes
// as they are. US-ASCII and UTF-8 are copied.
void charset_to_utf8(std::string_view charset, std::string_view text, std::string& out);

// A header value with its encoded words (RFC 2047, B and Q forms, any
// charset iconv knows) decoded to UTF-8; the blanks between two adjacent
// encoded words go. Anything else is kept as it is.
std::string header_words_decode(std::string_view value);

// A body's transfer encoding undone, fed in pieces of any size.
class TransferDecoder {
 public:
  enum class Kind { identity, base64, quoted_printable };
  explicit TransferDecoder(Kind kind) : kind_(kind) {}
  // The decoded bytes of the next piece appended to `out`.
  void feed(std::string_view in, std::string& out);
  // The input has ended: what was held back for the next piece goes out.
  void finish(std::string& out);

 private:
  Kind kind_;
  unsigned bits_ = 0;    // base64: bits waiting for a byte
  int bit_count_ = 0;
  std::string pending_;  // quoted-printable: an "=" whose two characters are still to come
};

// The transfer encoding a Content-Transfer-Encoding value names.
TransferDecoder::Kind transfer_kind(std::string_view value);

}  // namespace velmor
