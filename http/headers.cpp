#include "http/headers.h"

#include <algorithm>

#include "core/util.h"
#include "http/chars.h"

namespace velmor::http {

namespace {

std::string_view trim(std::string_view s) {
  while (!s.empty() && is_blank(s.front())) s.remove_prefix(1);
  while (!s.empty() && is_blank(s.back())) s.remove_suffix(1);
  return s;
}

bool is_token(std::string_view s) { return !s.empty() && std::all_of(s.begin(), s.end(), is_tchar); }

}  // namespace

void HeaderList::add(std::string_view name, std::string_view value) {
  fields_.push_back({std::string(name), std::string(value)});
}

void HeaderList::set(std::string_view name, std::string_view value) {
  auto first = std::find_if(fields_.begin(), fields_.end(), [&](const Field& f) { return str_iequals(f.name, name); });
  if (first == fields_.end()) {
    add(name, value);
    return;
  }
  first->value = std::string(value);
  fields_.erase(std::remove_if(first + 1, fields_.end(), [&](const Field& f) { return str_iequals(f.name, name); }),
                fields_.end());
}

std::size_t HeaderList::remove(std::string_view name) {
  return std::erase_if(fields_, [&](const Field& f) { return str_iequals(f.name, name); });
}

std::optional<std::string_view> HeaderList::get(std::string_view name) const {
  for (const Field& f : fields_) {
    if (str_iequals(f.name, name)) return f.value;
  }
  return std::nullopt;
}

std::size_t HeaderList::count(std::string_view name) const {
  return std::count_if(fields_.begin(), fields_.end(), [&](const Field& f) { return str_iequals(f.name, name); });
}

std::string HeaderList::joined(std::string_view name) const {
  std::string out;
  for (const Field& f : fields_) {
    if (!str_iequals(f.name, name)) continue;
    if (!out.empty()) out += ", ";
    out += f.value;
  }
  return out;
}

bool HeaderList::has_token(std::string_view name, std::string_view token) const {
  bool found = false;
  for (const Field& f : fields_) {
    if (str_iequals(f.name, name))
      for_each_list_item(f.value, [&](std::string_view item) { found = found || str_iequals(item, token); });
  }
  return found;
}

std::vector<std::string> HeaderList::connection_tokens() const {
  std::vector<std::string> tokens;
  for (const Field& f : fields_) {
    if (str_iequals(f.name, "Connection"))
      for_each_list_item(f.value, [&](std::string_view item) { tokens.push_back(str_lower(item)); });
  }
  return tokens;
}

void HeaderList::remove_hop_by_hop() {
  for (const std::string& token : connection_tokens()) {
    if (token != "transfer-encoding" && token != "content-length" && token != "host") remove(token);
  }
  for (const char* name : {"Connection", "Keep-Alive", "Proxy-Connection", "Proxy-Authenticate",
                           "Proxy-Authorization", "TE", "Trailer", "Upgrade"})
    remove(name);
}

void HeaderList::append_to_last(std::string_view more) {
  if (fields_.empty() || more.empty()) return;
  std::string& value = fields_.back().value;
  if (!value.empty()) value += ' ';
  value += more;
}

std::string HeaderList::text() const {
  std::string out;
  for (const Field& f : fields_) {
    if (!is_token(f.name)) continue;
    out += f.name;
    out += ": ";
    out += without_controls(f.value);
    out += "\r\n";
  }
  return out;
}

std::string without_controls(std::string_view text) {
  std::string out(text);
  std::replace_if(out.begin(), out.end(), [](char c) { return is_control(c) && c != '\t'; }, ' ');
  return out;
}

std::optional<std::string> field_parameter(std::string_view value, std::string_view name) {
  std::size_t i = value.find(';');
  while (i < value.size()) {
    ++i;  // past the ";"
    while (i < value.size() && is_blank(value[i])) ++i;
    std::size_t start = i;
    while (i < value.size() && is_tchar(value[i])) ++i;
    std::string_view key = value.substr(start, i - start);
    while (i < value.size() && is_blank(value[i])) ++i;
    if (i >= value.size() || value[i] != '=') {
      i = value.find(';', i);
      continue;
    }
    ++i;
    while (i < value.size() && is_blank(value[i])) ++i;
    std::string text;
    if (i < value.size() && value[i] == '"') {
      for (++i; i < value.size() && value[i] != '"'; ++i) {
        if (value[i] == '\\' && i + 1 < value.size()) ++i;
        text += value[i];
      }
      ++i;  // past the closing quote
    } else {
      while (i < value.size() && is_tchar(value[i])) text += value[i++];
    }
    if (str_iequals(key, name)) return text;
    i = value.find(';', i);
  }
  return std::nullopt;
}

// ---- reading lines and field lines --------------------------------------

LineStep LineReader::next(std::string_view text, std::string_view& line) {
  std::size_t end = text.find_first_of("\r\n", seen_);
  if (end == std::string_view::npos) {
    seen_ = text.size();
    return LineStep::need_more;
  }
  std::size_t after = end + 1;
  if (text[end] == '\r') {
    if (after == text.size()) {  // its LF may be on the way
      seen_ = end;
      return LineStep::need_more;
    }
    if (text[after] != '\n') {
      seen_ = end;
      return LineStep::bad;
    }
    ++after;
  } else if (!bare_lf_) {
    seen_ = end;
    return LineStep::bad;
  }
  line = text.substr(pos_, end - pos_);
  pos_ = seen_ = after;
  return LineStep::line;
}

bool add_field_line(std::string_view line, HeaderList& fields, FieldFold fold) {
  if (!line.empty() && is_blank(line.front())) {
    if (fold == FieldFold::refuse || fields.empty()) return false;
    std::string_view more = trim(line);
    if (std::any_of(more.begin(), more.end(), [](char c) { return is_control(c) && c != '\t'; })) return false;
    fields.append_to_last(more);
    return true;
  }
  std::size_t colon = line.find(':');
  if (colon == std::string_view::npos || !is_token(line.substr(0, colon))) return false;
  std::string_view value = trim(line.substr(colon + 1));
  if (std::any_of(value.begin(), value.end(), [](char c) { return is_control(c) && c != '\t'; })) return false;
  fields.add(line.substr(0, colon), value);
  return true;
}

}  // namespace velmor::http
