#include "http/form.h"

#include <algorithm>

#include "core/filecache.h"
#include "core/util.h"
#include "http/url.h"

namespace velmor::http {

// ---- urlencoded -----------------------------------------------------------------

namespace {

constexpr std::size_t kFormValueMax = 510;
constexpr std::size_t kFormTextMax = 254;
constexpr std::string_view kValueEnd = "&\r\n";

std::string decoded(std::string_view raw, DecodeResult* result = nullptr) {
  std::string text(raw);
  DecodeResult r = url_decode(text);
  if (result) *result = r;
  return text;
}

// The offset of the first of `chars` in the file from `pos`, or -1.
std::int64_t find_in_file(CacheFile& file, std::uint64_t pos, std::string_view chars) {
  for (std::string_view v; !(v = filecache_view(file, pos)).empty(); pos += v.size()) {
    std::size_t at = v.find_first_of(chars);
    if (at != std::string_view::npos) return static_cast<std::int64_t>(pos + at);
  }
  return -1;
}

}  // namespace

std::optional<std::string> form_value(std::string_view query, std::string_view name) {
  std::size_t q = query.find('?');
  if (q != std::string_view::npos) query.remove_prefix(q + 1);
  std::size_t i = 0;
  while (i <= query.size()) {
    std::size_t end = std::min(query.find('&', i), query.size());
    std::string_view field = query.substr(i, end - i);
    if (field.size() > name.size() && field[name.size()] == '=' && str_iequals(field.substr(0, name.size()), name)) {
      return decoded(field.substr(name.size() + 1, kFormValueMax));
    }
    i = end + 1;
  }
  return std::nullopt;
}

std::string form_text(std::string_view text) {
  text = text.substr(0, std::min(text.find('&'), text.size()));
  return decoded(text.substr(0, kFormTextMax));
}

std::vector<std::pair<std::string, std::string>> form_fields(std::string_view text) {
  std::vector<std::pair<std::string, std::string>> fields;
  std::size_t i = 0;
  while (i < text.size()) {
    std::size_t end = std::min(text.find('&', i), text.size());
    std::string_view field = text.substr(i, end - i);
    if (!field.empty()) {
      std::size_t eq = std::min(field.find('='), field.size());
      fields.emplace_back(decoded(field.substr(0, eq)), decoded(field.substr(std::min(eq + 1, field.size()))));
    }
    i = end + 1;
  }
  return fields;
}

std::int64_t form_file_offset(CacheFile& file, std::string_view name) {
  std::string head(name.size() + 1, '\0');
  std::uint64_t pos = 0;
  while (!filecache_at_end(file, pos)) {
    std::size_t n = filecache_read(file, head.data(), pos, head.size());
    if (n == head.size() && head.back() == '=' && str_iequals(std::string_view(head).substr(0, name.size()), name))
      return static_cast<std::int64_t>(pos + head.size());
    std::int64_t amp = find_in_file(file, pos, "&");
    if (amp < 0) return -1;
    pos = static_cast<std::uint64_t>(amp) + 1;
  }
  return -1;
}

std::optional<std::string> form_file_value(CacheFile& file, std::string_view name) {
  std::int64_t at = form_file_offset(file, name);
  if (at < 0) return std::nullopt;
  std::string raw(kFormValueMax, '\0');
  raw.resize(filecache_read(file, raw.data(), static_cast<std::uint64_t>(at), raw.size()));
  raw.resize(std::min(raw.find_first_of(kValueEnd), raw.size()));
  DecodeResult result = DecodeResult::ok;
  std::string value = decoded(raw, &result);
  if (result == DecodeResult::bad_escape) return std::nullopt;
  return value;
}

int form_file_copy(CacheFile& file, std::string_view name, CacheFile& destination) {
  std::int64_t at = form_file_offset(file, name);
  if (at < 0) return 1;
  std::uint64_t pos = static_cast<std::uint64_t>(at);
  std::string carry;  // a "%" escape cut by the end of a window
  for (std::string_view v; !(v = filecache_view(file, pos)).empty();) {
    std::size_t end = v.find_first_of(kValueEnd);
    bool last = end != std::string_view::npos;
    std::string_view piece = v.substr(0, last ? end : v.size());
    pos += piece.size();
    std::string chunk = carry + std::string(piece);
    carry.clear();
    if (!last) {
      std::size_t pct = chunk.rfind('%');
      if (pct != std::string::npos && chunk.size() - pct < 3) {
        carry = chunk.substr(pct);
        chunk.resize(pct);
      }
    }
    if (int err = filecache_write(destination, decoded(chunk))) return err;
    if (last) return 0;
  }
  return carry.empty() ? 0 : filecache_write(destination, carry);
}

// ---- multipart/form-data ----------------------------------------------------------

std::optional<std::string> multipart_boundary(std::string_view content_type) {
  std::optional<std::string> boundary = field_parameter(content_type, "boundary");
  if (!boundary || boundary->empty() || boundary->size() > 70) return std::nullopt;
  return boundary;
}

std::optional<std::vector<FormPart>> parse_multipart(std::string_view body, std::string_view boundary,
                                                     std::size_t max_parts) {
  if (boundary.empty()) return std::nullopt;
  const std::string delimiter = "\r\n--" + std::string(boundary);
  // The first delimiter may open the body, without the line end before it.
  const std::string_view first = std::string_view(delimiter).substr(2);
  std::size_t at = first.size();
  if (!body.starts_with(first)) {
    at = body.find(delimiter);
    if (at == std::string_view::npos) return std::nullopt;
    at += delimiter.size();
  }
  std::vector<FormPart> parts;
  for (;;) {
    std::string_view rest = body.substr(at);
    if (rest.starts_with("--")) return parts;  // the closing delimiter
    while (!rest.empty() && (rest.front() == ' ' || rest.front() == '\t')) rest.remove_prefix(1);
    if (!rest.starts_with("\r\n") || parts.size() == max_parts) return std::nullopt;
    rest.remove_prefix(2);
    FormPart part;
    LineReader lines(false);
    for (std::string_view line;;) {
      if (lines.next(rest, line) != LineStep::line) return std::nullopt;
      if (line.empty()) break;
      if (!add_field_line(line, part.headers, FieldFold::join)) return std::nullopt;
    }
    rest.remove_prefix(lines.pos());
    std::size_t end = rest.find(delimiter);
    if (end == std::string_view::npos) return std::nullopt;
    part.data = rest.substr(0, end);
    if (std::optional<std::string_view> disposition = part.headers.get("Content-Disposition")) {
      part.name = field_parameter(*disposition, "name").value_or("");
      part.filename = field_parameter(*disposition, "filename");
    }
    parts.push_back(std::move(part));
    at = static_cast<std::size_t>(rest.data() - body.data()) + end + delimiter.size();
  }
}

}  // namespace velmor::http
