#include "mail/imap_address.h"

namespace velmor {

namespace {

constexpr std::size_t kWordLimit = 253;

bool is_blank(char c) { return c == ' ' || c == '\t'; }

// At a CR or LF: past the line end when a blank follows (the value goes on),
// else false (the value ends there; the cursor stays).
bool skip_fold(std::string_view v, std::size_t& i) {
  std::size_t j = i;
  if (j < v.size() && v[j] == '\r') ++j;
  if (j < v.size() && v[j] == '\n') ++j;
  if (j == i || j >= v.size() || !is_blank(v[j])) return false;
  i = j;
  return true;
}

void add(std::string& word, char c) {
  if (word.size() < kWordLimit) word += c;
}

}  // namespace

AddressToken address_token_next(std::string_view v, std::size_t& i, std::string& word) {
  word.clear();
  for (;;) {
    while (i < v.size() && is_blank(v[i])) ++i;
    if (i >= v.size()) return AddressToken::end;
    char c = v[i];
    if (c == '\r' || c == '\n') {
      if (skip_fold(v, i)) continue;
      i = v.size();
      return AddressToken::end;
    }
    if (c == ',') {
      ++i;
      return AddressToken::comma;
    }
    if (c == '(') {  // a comment, nested ones counted
      int depth = 0;
      while (i < v.size()) {
        char d = v[i];
        if ((d == '\r' || d == '\n') && !skip_fold(v, i)) break;
        if (d == '\\' && i + 1 < v.size()) {
          i += 2;
          continue;
        }
        ++i;
        if (d == '(') ++depth;
        if (d == ')' && --depth == 0) break;
      }
      continue;
    }
    if (c == '"' || c == '<') {
      char close = c == '"' ? '"' : '>';
      ++i;
      while (i < v.size() && v[i] != close) {
        if ((v[i] == '\r' || v[i] == '\n') && !skip_fold(v, i)) return c == '"' ? AddressToken::quoted : AddressToken::angle;
        if (c == '"' && v[i] == '\\' && i + 1 < v.size()) ++i;
        if (c == '"' || !is_blank(v[i])) add(word, v[i]);
        ++i;
      }
      if (i < v.size()) ++i;  // the closing character
      return c == '"' ? AddressToken::quoted : AddressToken::angle;
    }
    while (i < v.size()) {
      char d = v[i];
      if (is_blank(d) || d == ',' || d == '<' || d == '(' || d == '"' || d == '\r' || d == '\n') break;
      add(word, d);
      ++i;
    }
    return AddressToken::atom;
  }
}

std::vector<MailAddress> mail_address_list(std::string_view value) {
  std::vector<MailAddress> list;
  std::size_t cursor = 0;
  std::string word, name, address;
  for (;;) {
    AddressToken t = address_token_next(value, cursor, word);
    if (t == AddressToken::comma || t == AddressToken::end) {
      if (!address.empty()) {
        std::size_t at = address.rfind('@');
        list.push_back({name, address.substr(0, at), address.substr(at + 1)});
      }
      if (t == AddressToken::end) return list;
      name.clear();
      address.clear();
      continue;
    }
    bool is_address = t != AddressToken::quoted && word.find('@') != std::string::npos;
    if (is_address) {
      address = word;
    } else if (!word.empty()) {
      if (!name.empty()) name += ' ';
      name += word;
    }
  }
}

}  // namespace velmor
