// Test support: a FETCH response read the way a client reads it, literals
// by their counts, strings by their quoting, so that tests and fuzz targets
// can tell a response that parses from one that only looks right.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace velmor::imap_check {

struct Value {
  enum class Kind { atom, string, list };
  Kind kind = Kind::atom;
  std::string text;  // an atom as written, a string's contents
  std::vector<Value> list;
  bool literal = false;
};

class Reader {
 public:
  explicit Reader(std::string_view r) : r_(r) {}

  // "* n FETCH (name value ...)\r\n" and nothing after it; "" or what is wrong.
  std::string fetch(std::uint32_t& seq, std::vector<std::pair<std::string, Value>>& items) {
    if (!eat("* ")) return "no untagged start";
    std::string n = atom();
    if (n.empty() || n.find_first_not_of("0123456789") != std::string::npos) return "no sequence number";
    seq = static_cast<std::uint32_t>(std::stoul(n));
    if (!eat(" FETCH (")) return "no FETCH (";
    for (;;) {
      std::string name = item_name();
      if (name.empty()) return "no item name at " + std::to_string(i_);
      if (!eat(" ")) return "no blank after " + name;
      Value v;
      if (std::string e = value(v); !e.empty()) return e;
      items.emplace_back(std::move(name), std::move(v));
      if (eat(")")) break;
      if (!eat(" ")) return "no blank between items at " + std::to_string(i_);
    }
    if (!eat("\r\n")) return "no line end";
    if (i_ != r_.size()) return "bytes after the response";
    return {};
  }

 private:
  bool eat(std::string_view s) {
    if (r_.substr(i_, s.size()) != s) return false;
    i_ += s.size();
    return true;
  }
  static bool atom_char(char c) {
    auto u = static_cast<unsigned char>(c);
    return u > ' ' && u < 0x7f && c != '(' && c != ')' && c != '"' && c != '{' && c != '%' && c != '*';
  }
  std::string atom() {
    std::size_t from = i_;
    while (i_ < r_.size() && atom_char(r_[i_]) && r_[i_] != '[') ++i_;
    return std::string(r_.substr(from, i_ - from));
  }
  // An item name; a section in brackets may hold blanks and parentheses.
  std::string item_name() {
    std::size_t from = i_;
    while (i_ < r_.size() && atom_char(r_[i_]) && r_[i_] != '[') ++i_;
    if (i_ < r_.size() && r_[i_] == '[') {
      int depth = 0;
      bool quoted = false;
      for (; i_ < r_.size(); ++i_) {
        char c = r_[i_];
        if (quoted) {
          if (c == '\\') ++i_;
          else if (c == '"') quoted = false;
          continue;
        }
        if (c == '"') quoted = true;
        if (c == '[') ++depth;
        if (c == ']' && --depth == 0) break;
        if (c == '\r' || c == '\n') return {};
      }
      if (i_ >= r_.size()) return {};
      ++i_;
      if (i_ < r_.size() && r_[i_] == '<') {
        std::size_t gt = r_.find('>', i_);
        if (gt == std::string_view::npos) return {};
        i_ = gt + 1;
      }
    }
    return std::string(r_.substr(from, i_ - from));
  }
  std::string value(Value& v) {
    if (i_ >= r_.size()) return "cut off";
    char c = r_[i_];
    if (c == '(') {
      ++i_;
      v.kind = Value::Kind::list;
      if (eat(")")) return {};
      for (;;) {
        Value e;
        if (std::string err = value(e); !err.empty()) return err;
        v.list.push_back(std::move(e));
        if (eat(")")) return {};
        if (!eat(" ") && (i_ >= r_.size() || r_[i_] != '(')) return "bad list at " + std::to_string(i_);
      }
    }
    if (c == '"') {
      v.kind = Value::Kind::string;
      for (++i_; i_ < r_.size() && r_[i_] != '"'; ++i_) {
        char d = r_[i_];
        auto u = static_cast<unsigned char>(d);
        if (u == 0 || d == '\r' || d == '\n' || u >= 0x80) return "bad byte in a quoted string at " + std::to_string(i_);
        if (d == '\\') {
          if (i_ + 1 >= r_.size() || (r_[i_ + 1] != '\\' && r_[i_ + 1] != '"')) return "bad escape";
          d = r_[++i_];
        }
        v.text += d;
      }
      if (!eat("\"")) return "unclosed string";
      return {};
    }
    if (c == '{') {
      std::size_t close = r_.find('}', i_);
      if (close == std::string_view::npos) return "bad literal";
      std::string n(r_.substr(i_ + 1, close - i_ - 1));
      if (n.empty() || n.size() > 12 || n.find_first_not_of("0123456789") != std::string::npos) return "bad count";
      std::size_t count = std::stoull(n);
      i_ = close + 1;
      if (!eat("\r\n")) return "no line end after a literal count";
      if (r_.size() - i_ < count) return "literal cut off";
      v.kind = Value::Kind::string;
      v.literal = true;
      v.text = r_.substr(i_, count);
      i_ += count;
      if (i_ >= r_.size() || (r_[i_] != ' ' && r_[i_] != ')')) return "a literal not followed by a blank or )";
      return {};
    }
    v.text = atom();
    if (v.text.empty()) return "nothing at " + std::to_string(i_);
    return {};
  }

  std::string_view r_;
  std::size_t i_ = 0;
};

// The value of item `name` ("" and nullptr when absent).
inline const Value* find(const std::vector<std::pair<std::string, Value>>& items, std::string_view name) {
  for (const auto& [n, v] : items) {
    if (n == name) return &v;
  }
  return nullptr;
}

}  // namespace velmor::imap_check
