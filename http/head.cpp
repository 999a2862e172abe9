#include "http/head.h"

#include <algorithm>

#include "http/chars.h"

namespace velmor::http {

namespace {

enum class StartLine { bad, fields_follow, alone };

// "HTTP/" DIGIT "." DIGIT, case-sensitive; 10 * major + minor, or -1.
int version_of(std::string_view text) {
  if (text.size() != 8 || text.substr(0, 5) != "HTTP/" || !is_digit(text[5]) || text[6] != '.' || !is_digit(text[7]))
    return -1;
  return (text[5] - '0') * 10 + (text[7] - '0');
}

bool has_control(std::string_view s, bool tab_ok) {
  return std::any_of(s.begin(), s.end(), [&](char c) { return is_control(c) && !(tab_ok && c == '\t'); });
}

StartLine request_line(std::string_view line, RequestHead& head) {
  std::size_t sp = line.find(' ');
  if (sp == std::string_view::npos || sp == 0) return StartLine::bad;
  std::string_view method = line.substr(0, sp);
  if (!std::all_of(method.begin(), method.end(), is_tchar)) return StartLine::bad;
  std::string_view rest = line.substr(sp + 1);
  std::size_t sp2 = rest.find(' ');
  std::string_view target = rest.substr(0, sp2);
  if (target.empty() || has_control(target, false)) return StartLine::bad;
  head.method = std::string(method);
  head.target = std::string(target);
  if (sp2 == std::string_view::npos) {
    // A simple request: only GET was ever written so, and nothing follows.
    if (method != "GET") return StartLine::bad;
    head.version = 9;
    return StartLine::alone;
  }
  head.version = version_of(rest.substr(sp2 + 1));
  return head.version < 0 ? StartLine::bad : StartLine::fields_follow;
}

StartLine status_line(std::string_view line, ResponseHead& head) {
  head.version = version_of(line.substr(0, 8));
  if (head.version < 0 || line.size() < 12 || line[8] != ' ') return StartLine::bad;
  std::string_view code = line.substr(9, 3);
  if (!std::all_of(code.begin(), code.end(), is_digit) || code[0] < '1' || code[0] > '5') return StartLine::bad;
  head.status = (code[0] - '0') * 100 + (code[1] - '0') * 10 + (code[2] - '0');
  // The blank before an empty reason is often left out.
  std::string_view reason = line.substr(12);
  if (!reason.empty() && reason.front() != ' ') return StartLine::bad;
  if (!reason.empty()) reason.remove_prefix(1);
  if (has_control(reason, true)) return StartLine::bad;
  head.reason = std::string(reason);
  return StartLine::fields_follow;
}

}  // namespace

namespace detail {

HeadResult HeadReader::fail(HeadResult result, std::string_view why) {
  error_ = why;
  return ended_ = result;
}

template <class Start>
HeadResult HeadReader::read(std::string_view buffered, HeaderList& fields, Start start) {
  if (ended_ != HeadResult::need_more) return ended_;
  for (;;) {
    std::string_view line;
    LineStep step = lines_.next(buffered, line);
    if (step == LineStep::bad) {
      // Past the limit the head is too big, however it goes on.
      if (lines_.seen() + 1 > limits_.max_bytes) return fail(HeadResult::too_big, "the head is too long");
      return fail(HeadResult::bad, "a CR that does not end a line");
    }
    if (step == LineStep::need_more) {
      if (buffered.size() > limits_.max_bytes) return fail(HeadResult::too_big, "the head is too long");
      return HeadResult::need_more;
    }
    if (lines_.pos() > limits_.max_bytes) return fail(HeadResult::too_big, "the head is too long");
    if (!started_) {
      if (line.empty()) continue;  // blank lines before the start line
      StartLine kind = start(line);
      if (kind == StartLine::bad) return fail(HeadResult::bad, "a bad start line");
      started_ = true;
      if (kind == StartLine::fields_follow) continue;
    } else if (!line.empty()) {
      if (!add_field_line(line, fields, fold_)) return fail(HeadResult::bad, "a bad field line");
      if (fields.size() > limits_.max_fields) return fail(HeadResult::too_big, "too many fields");
      continue;
    }
    used_ = lines_.pos();
    return ended_ = HeadResult::complete;
  }
}

}  // namespace detail

HeadResult RequestParser::parse(std::string_view buffered) {
  return read(buffered, head.headers, [&](std::string_view line) { return request_line(line, head); });
}

HeadResult ResponseParser::parse(std::string_view buffered) {
  return read(buffered, head.headers, [&](std::string_view line) { return status_line(line, head); });
}

}  // namespace velmor::http
