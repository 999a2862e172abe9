// Form data: application/x-www-form-urlencoded fields, in a query, in a text
// or in a request body kept in a file, and multipart/form-data bodies.
// Field names are compared without regard to case.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "http/headers.h"

namespace velmor {
class CacheFile;
}

namespace velmor::http {

// ---- urlencoded ---------------------------------------------------------------

// In the text after "?" (or the whole text when there is none), the value of
// the first "name=" field, up to "&" and at most 510 characters, decoded.
std::optional<std::string> form_value(std::string_view query, std::string_view name);
// The text up to "&", at most 254 characters, decoded.
std::string form_text(std::string_view text);
// Every field in order, names and values decoded; a field without "=" has an
// empty value.
std::vector<std::pair<std::string, std::string>> form_fields(std::string_view text);

// A body in a file: the offset where the value of "name=" starts, or -1.
std::int64_t form_file_offset(CacheFile& file, std::string_view name);
// That value, up to "&", CR or LF and at most 510 characters, decoded;
// nullopt when absent or when it holds a bad "%" escape.
std::optional<std::string> form_file_value(CacheFile& file, std::string_view name);
// Copies the decoded value, of any length, into `destination`: 0, 1 when
// the field is absent, else the file cache's error.
int form_file_copy(CacheFile& file, std::string_view name, CacheFile& destination);

// ---- multipart/form-data --------------------------------------------------------

struct FormPart {
  HeaderList headers;
  std::string name;                     // the name parameter of Content-Disposition
  std::optional<std::string> filename;  // an uploaded file's name, when given
  std::string_view data;                // the part's content, inside the body
};

// The boundary parameter of a multipart Content-Type value (1 to 70
// characters), or nullopt.
std::optional<std::string> multipart_boundary(std::string_view content_type);
// The parts of a multipart body, in order; nullopt when it has no closing
// delimiter, a part has no blank line after its fields, or it has more than
// `max_parts` parts. The preamble and the epilogue are skipped.
std::optional<std::vector<FormPart>> parse_multipart(std::string_view body, std::string_view boundary,
                                                     std::size_t max_parts = 1000);

}  // namespace velmor::http
