// The FETCH item list: one item, a macro or a parenthesised list, read
// strictly so that what we answer is what the client asked.
#include <charconv>

#include "core/util.h"
#include "mail/imap_render.h"

namespace velmor {

namespace {

bool is_digit(char c) { return c >= '0' && c <= '9'; }

bool is_word_char(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || is_digit(c) || c == '.';
}

// A character of a header field name (printable, no colon).
bool is_field_char(char c) {
  auto u = static_cast<unsigned char>(c);
  return u > ' ' && u < 0x7f && c != ':';
}

// One that may also stand unquoted in the item list.
bool is_name_char(char c) {
  return is_field_char(c) && c != '(' && c != ')' && c != '{' && c != '"' && c != '\\' && c != ']' && c != '%' &&
         c != '*';
}

class ItemParser {
 public:
  explicit ItemParser(std::string_view text) : t_(text) {}

  bool parse(FetchRequest& request) {
    while (!t_.empty() && (t_.back() == ' ' || t_.back() == '\r' || t_.back() == '\n')) t_.remove_suffix(1);
    std::vector<FetchItem>& items = request.items;
    items.clear();
    if (eat('(')) {
      do {
        if (!item(items)) return false;
      } while (eat(' '));
      if (!eat(')')) return false;
    } else if (!item(items)) {
      return false;
    }
    return i_ == t_.size() && !items.empty();
  }

 private:
  bool at(char c) const { return i_ < t_.size() && t_[i_] == c; }
  bool eat(char c) {
    if (!at(c)) return false;
    ++i_;
    return true;
  }

  std::string word() {
    std::size_t from = i_;
    while (i_ < t_.size() && is_word_char(t_[i_])) ++i_;
    std::string w(t_.substr(from, i_ - from));
    for (char& c : w) {
      if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
    }
    return w;
  }

  bool number(std::uint32_t& n) {
    std::size_t from = i_;
    while (i_ < t_.size() && is_digit(t_[i_])) ++i_;
    if (i_ == from) return false;
    auto r = std::from_chars(t_.data() + from, t_.data() + i_, n);
    return r.ec == std::errc() && r.ptr == t_.data() + i_;
  }

  static FetchItem simple(FetchAtt att) {
    FetchItem it;
    it.att = att;
    return it;
  }

  static FetchItem whole(FetchItem::Name name, FetchSection::Kind kind, bool peek) {
    FetchItem it;
    it.att = FetchAtt::section;
    it.name = name;
    it.section.kind = kind;
    it.peek = peek;
    return it;
  }

  bool item(std::vector<FetchItem>& items) {
    using Kind = FetchSection::Kind;
    using Name = FetchItem::Name;
    std::string w = word();
    if (w == "ALL" || w == "FAST" || w == "FULL") {
      for (FetchAtt a : {FetchAtt::flags, FetchAtt::internaldate, FetchAtt::rfc822_size}) items.push_back(simple(a));
      if (w != "FAST") items.push_back(simple(FetchAtt::envelope));
      if (w == "FULL") items.push_back(simple(FetchAtt::body));
      return true;
    }
    static const struct {
      const char* name;
      FetchAtt att;
    } kSimple[] = {{"ENVELOPE", FetchAtt::envelope},   {"FLAGS", FetchAtt::flags},
                   {"INTERNALDATE", FetchAtt::internaldate}, {"RFC822.SIZE", FetchAtt::rfc822_size},
                   {"UID", FetchAtt::uid},             {"BODYSTRUCTURE", FetchAtt::bodystructure}};
    for (const auto& s : kSimple) {
      if (w == s.name) {
        items.push_back(simple(s.att));
        return true;
      }
    }
    if (w == "RFC822" || w == "RFC822.PEEK") {
      items.push_back(whole(Name::rfc822, Kind::all, w != "RFC822"));
      return true;
    }
    if (w == "RFC822.HEADER") {
      items.push_back(whole(Name::rfc822_header, Kind::header, true));
      return true;
    }
    if (w == "RFC822.TEXT" || w == "RFC822.TEXT.PEEK") {
      items.push_back(whole(Name::rfc822_text, Kind::text, w != "RFC822.TEXT"));
      return true;
    }
    if (w == "BODY" && !at('[')) {
      items.push_back(simple(FetchAtt::body));
      return true;
    }
    if (w != "BODY" && w != "BODY.PEEK") return false;
    FetchItem it = whole(Name::body, Kind::all, w == "BODY.PEEK");
    if (!section(it.section)) return false;
    if (eat('<')) {
      it.partial = true;
      if (!number(it.start) || !eat('.') || !number(it.count) || !eat('>')) return false;
    }
    items.push_back(std::move(it));
    return true;
  }

  // "[" [part numbers ["." text] | text] "]"
  bool section(FetchSection& s) {
    using Kind = FetchSection::Kind;
    if (!eat('[')) return false;
    if (eat(']')) return true;
    bool after_dot = true;
    if (i_ < t_.size() && is_digit(t_[i_])) {
      after_dot = false;
      for (;;) {
        std::uint32_t n = 0;
        if (!number(n) || n == 0) return false;
        s.part.push_back(n);
        if (!eat('.')) break;
        if (i_ >= t_.size() || !is_digit(t_[i_])) {
          after_dot = true;
          break;
        }
      }
    }
    if (after_dot) {
      std::string w = word();
      if (w == "HEADER") {
        s.kind = Kind::header;
      } else if (w == "TEXT") {
        s.kind = Kind::text;
      } else if (w == "MIME" && !s.part.empty()) {
        s.kind = Kind::mime;
      } else if (w == "HEADER.FIELDS" || w == "HEADER.FIELDS.NOT") {
        s.kind = w == "HEADER.FIELDS" ? Kind::fields : Kind::fields_not;
        if (!eat(' ') || !field_list(s.fields)) return false;
      } else {
        return false;
      }
    }
    return eat(']');
  }

  bool field_list(std::vector<std::string>& names) {
    if (!eat('(')) return false;
    do {
      std::string name;
      if (!field_name(name)) return false;
      names.push_back(std::move(name));
    } while (eat(' '));
    return eat(')');
  }

  bool field_name(std::string& name) {
    if (eat('"')) {
      while (i_ < t_.size() && t_[i_] != '"') {
        if (t_[i_] == '\\' && (++i_ >= t_.size() || (t_[i_] != '\\' && t_[i_] != '"'))) return false;
        if (!is_field_char(t_[i_])) return false;
        name += t_[i_++];
      }
      return eat('"') && !name.empty();
    }
    std::size_t from = i_;
    while (i_ < t_.size() && is_name_char(t_[i_])) ++i_;
    name.assign(t_.substr(from, i_ - from));
    return !name.empty();
  }

  std::string_view t_;
  std::size_t i_ = 0;
};

}  // namespace

bool FetchRequest::sets_seen() const {
  for (const FetchItem& it : items) {
    if (it.att == FetchAtt::section && !it.peek) return true;
  }
  return false;
}

FetchParse imap_fetch_parse(std::string_view text, FetchRequest& request) {
  ItemParser p(text);
  if (p.parse(request)) return FetchParse::ok;
  request.items.clear();
  return FetchParse::bad;
}

}  // namespace velmor
