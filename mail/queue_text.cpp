#include "mail/queue_text.h"

#include <arpa/inet.h>

#include <algorithm>
#include <cstdint>

#include "core/util.h"

namespace velmor {

std::string_view envelope_address(std::string_view line) {
  line = line_cut(line);
  std::size_t pos = line.find_first_of(":<");
  if (pos == std::string_view::npos) return {};
  bool bracketed = false;
  while (pos < line.size() && (line[pos] == ':' || line[pos] == '<' || line[pos] == ' ' || line[pos] == '\t')) {
    if (line[pos] == '<') bracketed = true;
    ++pos;
  }
  std::string_view rest = line.substr(pos);
  std::size_t end = bracketed ? rest.find('>') : rest.find_first_of(" \t");
  if (end == std::string_view::npos) end = rest.size();
  rest = rest.substr(0, end);
  while (!rest.empty() && (rest.back() == ' ' || rest.back() == '\t')) rest.remove_suffix(1);
  return rest;
}

bool envelope_keyword(std::string_view argument, std::string_view keyword) {
  if (!str_istarts_with(argument, keyword)) return false;
  argument.remove_prefix(keyword.size());
  while (!argument.empty() && (argument.front() == ' ' || argument.front() == '\t')) argument.remove_prefix(1);
  return !argument.empty() && argument.front() == ':';
}

EnvelopePath parse_envelope_path(std::string_view argument, std::string_view keyword, bool allow_empty) {
  EnvelopePath path;
  if (!envelope_keyword(argument, keyword)) return path;
  path.address = envelope_address(argument);
  std::size_t end = path.address.data() ? static_cast<std::size_t>(path.address.data() - argument.data()) +
                                              path.address.size()
                                        : argument.size();
  path.parameters = trim_blanks(argument.substr(std::min(end, argument.size())));
  if (!path.parameters.empty() && path.parameters.front() == '>') path.parameters = trim_blanks(path.parameters.substr(1));
  if (path.address.empty() && !allow_empty) return path;
  if (path.address.size() > kMaxAddress) {
    path.result = PathResult::too_long;
  } else {
    path.result = envelope_address_fits(path.address) ? PathResult::ok : PathResult::bad_chars;
  }
  return path;
}

SizeParameter mail_size_parameter(std::string_view parameters, std::uint64_t& size) {
  while (!parameters.empty()) {
    std::size_t start = parameters.find_first_not_of(" \t");
    if (start == std::string_view::npos) break;
    parameters.remove_prefix(start);
    std::string_view word = parameters.substr(0, parameters.find_first_of(" \t"));
    parameters.remove_prefix(word.size());
    if (!str_istarts_with(word, "SIZE=")) continue;
    std::string_view digits = word.substr(5);
    if (digits.empty() || digits.size() > 20 || digits.find_first_not_of("0123456789") != std::string_view::npos)
      return SizeParameter::bad;
    size = 0;
    for (char c : digits) {
      unsigned d = static_cast<unsigned>(c - '0');
      size = size > (UINT64_MAX - d) / 10 ? UINT64_MAX : size * 10 + d;
    }
    return SizeParameter::given;
  }
  return SizeParameter::absent;
}

bool envelope_address_fits(std::string_view address) {
  return address.size() <= kMaxAddress && std::none_of(address.begin(), address.end(), [](char c) {
           auto u = static_cast<unsigned char>(c);
           return u <= ' ' || u == 0x7f || c == '<' || c == '>';
         });
}

std::string_view address_domain(std::string_view address) {
  std::size_t at = address.rfind('@');
  return at == std::string_view::npos ? std::string_view{} : address.substr(at + 1);
}

bool address_is_private(std::uint32_t peer_nbo) {
  std::uint32_t a = ntohl(peer_nbo);
  return (a >> 24) == 127 || (a >> 24) == 10 || (a >> 20) == 0xac1 || (a >> 16) == 0xc0a8;
}

bool clear_login_allowed(std::uint32_t peer_nbo, bool secure) {
  return secure || config.tls_plain_login || address_is_private(peer_nbo);
}

bool relay_permitted(std::uint32_t peer_nbo, const AddressList& allow) {
  if (!allow.empty()) return address_list_match(allow, peer_nbo);
  return address_is_private(peer_nbo);
}

std::vector<std::string> filter_phrases(std::string_view filter) {
  std::vector<std::string> phrases;
  std::size_t pos = 0;
  while (pos < filter.size()) {
    while (pos < filter.size() && (filter[pos] == ' ' || filter[pos] == '\t')) ++pos;
    std::string phrase;
    if (pos < filter.size() && filter[pos] == '\'') {
      std::size_t close = filter.find('\'', pos + 1);
      if (close == std::string_view::npos) close = filter.size();
      phrase = filter.substr(pos + 1, close - pos - 1);
      pos = filter.find(',', close);
    } else {
      std::size_t comma = filter.find(',', pos);
      phrase = filter.substr(pos, comma == std::string_view::npos ? std::string_view::npos : comma - pos);
      while (!phrase.empty() && (phrase.back() == ' ' || phrase.back() == '\t')) phrase.pop_back();
      pos = comma;
    }
    if (phrase.size() > 60) phrase.resize(60);
    if (!phrase.empty()) phrases.push_back(std::move(phrase));
    if (pos == std::string_view::npos) break;
    ++pos;  // past the comma
  }
  return phrases;
}

std::string mail_date_text(std::time_t t) { return date_text(t, "%a, %d %b %Y %H:%M:%S %z"); }

void MessageReceiver::end_of_header(std::string& out) {
  in_header_ = false;
  if (date_seen_ || !add_date) return;
  out += "Date: ";
  out += mail_date_text(now ? now : std::time(nullptr));
  out += "\r\n";
  date_added_ = true;
}

std::size_t MessageReceiver::feed(std::string_view input, bool force, std::string& out,
                                  std::string* header_lines) {
  std::size_t pos = 0;
  while (!done_ && pos < input.size()) {
    std::size_t lf = input.find('\n', pos);
    if (lf == std::string_view::npos) {
      if (!force) break;
      // A line longer than the input buffer: pass its first part on. A CR at
      // the very end may be the first half of the line end, so it waits.
      std::string_view part = input.substr(pos);
      if (part.back() == '\r') part.remove_suffix(1);
      if (part.empty()) break;
      if (at_line_start_ && in_header_ && str_istarts_with(part, "date:")) date_seen_ = true;
      out += part;
      pos += part.size();
      at_line_start_ = false;
      break;
    }
    std::string_view line = input.substr(pos, lf - pos);
    if (!line.empty() && line.back() == '\r') line.remove_suffix(1);
    pos = lf + 1;
    if (at_line_start_) {
      if (line == ".") {
        if (in_header_) end_of_header(out);
        out += ".\r\n";
        done_ = true;
        break;
      }
      if (in_header_) {
        if (line.empty()) {
          end_of_header(out);
        } else {
          if (str_istarts_with(line, "date:")) date_seen_ = true;
          if (header_lines) {
            *header_lines += line;
            *header_lines += "\r\n";
          }
        }
      }
    }
    out += line;
    out += "\r\n";
    at_line_start_ = true;
  }
  return pos;
}

}  // namespace velmor
