// The fields of a message head: an ordered list that keeps names as they
// were written, duplicates and order, and compares names without regard to
// case. Also the line reader and field-line parser that the head parser and
// the chunked decoder's trailers share.
#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace velmor::http {

struct Field {
  std::string name;
  std::string value;  // without the white space around it
  bool operator==(const Field&) const = default;
};

class HeaderList {
 public:
  void add(std::string_view name, std::string_view value);
  // Replaces every field of that name by one, where the first stood (at the
  // end when there was none).
  void set(std::string_view name, std::string_view value);
  // Removes every field of that name; how many there were.
  std::size_t remove(std::string_view name);

  // The value of the first field of that name.
  std::optional<std::string_view> get(std::string_view name) const;
  std::size_t count(std::string_view name) const;
  bool has(std::string_view name) const { return count(name) > 0; }
  // Every value of the fields of that name, as one comma-separated list.
  std::string joined(std::string_view name) const;
  // Whether the comma-separated values of the named fields hold the token
  // (without regard to case): has_token("Connection", "close").
  bool has_token(std::string_view name, std::string_view token) const;

  // The options of the Connection fields, lower-cased, in order.
  std::vector<std::string> connection_tokens() const;
  // Removes what concerns this hop only: Connection and the fields it names,
  // Keep-Alive, Proxy-Connection, Proxy-Authenticate, Proxy-Authorization,
  // TE, Trailer and Upgrade. Transfer-Encoding, Content-Length and Host stay
  // even when Connection names them: they say where the body ends, and
  // dropping them on a peer's word would let it smuggle a second message.
  void remove_hop_by_hop();

  // Joins a continuation line to the last field with one blank.
  void append_to_last(std::string_view more);

  // "Name: value" CR LF for each field, in order. What a field holds cannot
  // split the head: a field whose name is not a token is left out, and a
  // control byte (HTAB aside) in a value goes out as a blank.
  std::string text() const;

  const std::vector<Field>& fields() const { return fields_; }
  std::size_t size() const { return fields_.size(); }
  bool empty() const { return fields_.empty(); }
  bool operator==(const HeaderList&) const = default;

 private:
  std::vector<Field> fields_;
};

// The text with every control byte but HTAB turned into a blank.
std::string without_controls(std::string_view text);

// Calls f(item) for each item of a comma-separated field value, white space
// around it trimmed, empty items skipped.
template <class F>
void for_each_list_item(std::string_view value, F f) {
  std::size_t i = 0;
  while (i <= value.size()) {
    std::size_t end = value.find(',', i);
    if (end == std::string_view::npos) end = value.size();
    std::string_view item = value.substr(i, end - i);
    while (!item.empty() && (item.front() == ' ' || item.front() == '\t')) item.remove_prefix(1);
    while (!item.empty() && (item.back() == ' ' || item.back() == '\t')) item.remove_suffix(1);
    if (!item.empty()) f(item);
    i = end + 1;
  }
}

// The value of a parameter after the first item of a field value
// ("multipart/form-data; boundary=x", "form-data; name=\"to\""): a token or
// a quoted string, unquoted. The name is compared without regard to case.
std::optional<std::string> field_parameter(std::string_view value, std::string_view name);

// ---- reading lines and field lines --------------------------------------

enum class LineStep { line, need_more, bad };

// Reads lines from a buffer that grows between calls, remembering where the
// search for the line end stopped so that no byte is looked at twice.
class LineReader {
 public:
  // `bare_lf`: a LF alone ends a line too (a CR before it is part of the
  // end). A CR that is not followed by LF is always bad.
  explicit LineReader(bool bare_lf) : bare_lf_(bare_lf) {}
  // The next line of `text` from pos(), without its end; pos() moves past it.
  LineStep next(std::string_view text, std::string_view& line);
  std::size_t pos() const { return pos_; }
  // After need_more or bad: where the line's end or fault was looked for
  // (bytes before it belong to the line whatever comes), for limits.
  std::size_t seen() const { return seen_; }

 private:
  bool bare_lf_;
  std::size_t pos_ = 0;   // start of the next line
  std::size_t seen_ = 0;  // searched up to here without an end, or the fault
};

enum class FieldFold { refuse, join };

// Adds one field line ("name: value") to the list. A line that starts with a
// blank continues the previous field (obsolete folding): refused, or joined
// to it with one blank. A name must be a token directly followed by the
// colon; a value holds no control byte but HTAB. False when the line is bad.
bool add_field_line(std::string_view line, HeaderList& fields, FieldFold fold);

}  // namespace velmor::http
