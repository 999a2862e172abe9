// One message's FETCH response, read from the mailbox file with the help of
// its overview record. Sizes are known before the bytes are sent: the
// record counts the dots of transmission form, and only a range of a
// message that has some is scanned to count them.
#include "mail/imap_render.h"

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <functional>

#include "core/strfmt.h"
#include "core/util.h"
#include "mail/imap_address.h"
#include "mail/mailfile.h"
#include "mail/mime_text.h"

namespace velmor {

namespace {

constexpr std::size_t kWindow = 64 * 1024;
// Of one header field's value: what an envelope or a structure shows of it.
constexpr std::size_t kFieldKeep = 64 * 1024;
// How far before a MIME part's body its header is looked for.
constexpr std::uint64_t kPartHeaderWindow = 64 * 1024;
// Structures nest at most this deep and show at most this many parts: a
// multipart past either bound is shown, and addressed, as one opaque body.
constexpr int kDepthLimit = 32;
constexpr std::size_t kPartLimit = 1000;
constexpr std::uint64_t kUnknown = ~std::uint64_t{0};
const std::vector<std::size_t> kNoParts;

bool is_blank(char c) { return c == ' ' || c == '\t'; }

std::string upper(std::string_view s) {
  std::string u(s);
  for (char& c : u) {
    if (c >= 'a' && c <= 'z') c = static_cast<char>(c - 'a' + 'A');
  }
  return u;
}

// Calls `f` with successive pieces of the stored bytes [s, e) until it
// returns false; false when the source ends first.
template <typename F>
bool each_piece(ByteSource& file, std::uint64_t s, std::uint64_t e, F&& f) {
  while (s < e) {
    std::string_view v = file.view(s, kWindow);
    if (v.empty()) return false;
    v = v.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(v.size(), e - s)));
    if (!f(v)) return true;
    s += v.size();
  }
  return true;
}

// The stuffed dots in [s, e): a "." at a line start (`line_start` tells
// whether s is one).
std::uint64_t dots_in(ByteSource& file, std::uint64_t s, std::uint64_t e, bool line_start) {
  std::uint64_t n = 0;
  bool at_start = line_start;
  each_piece(file, s, e, [&](std::string_view v) {
    for (char c : v) {
      if (at_start && c == '.') ++n;
      at_start = c == '\n';
    }
    return true;
  });
  return n;
}

std::uint64_t lines_in(ByteSource& file, std::uint64_t s, std::uint64_t e) {
  std::uint64_t n = 0;
  char last = '\n';
  each_piece(file, s, e, [&](std::string_view v) {
    n += static_cast<std::uint64_t>(std::count(v.begin(), v.end(), '\n'));
    last = v.back();
    return true;
  });
  return n + (last != '\n' ? 1 : 0);
}

// The plain bytes of [s, e) appended to `out`.
bool append_plain(ByteSource& file, std::uint64_t s, std::uint64_t e, bool unstuff, bool line_start, std::string& out) {
  bool at_start = line_start;
  return each_piece(file, s, e, [&](std::string_view v) {
    if (!unstuff) {
      out.append(v);
      return true;
    }
    for (char c : v) {
      if (!(at_start && c == '.')) out += c;
      at_start = c == '\n';
    }
    return true;
  });
}

bool within(const ByteSource& file, const MessageRecord& m, std::uint64_t offset) {
  return m.total_length <= file.size() && offset <= file.size() - m.total_length && m.length <= m.total_length;
}

// Counts what a record from an old overview lacks, as parsing does: the
// stuffed dots, the closing "." line and the lines of the body.
bool count_text(ByteSource& file, MessageRecord& m, std::uint64_t offset) {
  if (m.dots != kUncounted) return true;
  std::uint64_t start = offset + (m.total_length - m.length), stop = offset + m.total_length;
  std::uint64_t body = offset + std::clamp<std::uint64_t>(m.header_length, m.total_length - m.length, m.total_length);
  std::uint64_t dots = 0, lines = 0, last = start, pos = start;
  bool at_start = true;
  bool whole = each_piece(file, start, stop, [&](std::string_view v) {
    for (char c : v) {
      if (at_start) {
        last = pos;
        if (c == '.') ++dots;
        if (pos >= body) ++lines;
      }
      at_start = c == '\n';
      ++pos;
    }
    return true;
  });
  if (!whole || file.failed()) return false;
  std::uint32_t end_line = 0;
  if (stop - last <= 3 && is_terminator_line(file.view(last, 3).substr(0, static_cast<std::size_t>(stop - last)))) {
    end_line = static_cast<std::uint32_t>(stop - last);
    --dots;
    if (last >= body) --lines;
  }
  m.dots = dots;
  m.body_lines = lines;
  m.end_line = end_line;
  return true;
}

// ---- header fields ---------------------------------------------------------------

// Calls `f(name, value)` for each field of the header in [s, e), its value
// unfolded (line ends of continuations removed) and trimmed. Stops at the
// blank line, or when `f` returns false.
template <typename F>
void each_field(ByteSource& file, std::uint64_t s, std::uint64_t e, F&& f) {
  std::string field;
  bool have = false, go_on = true;
  auto flush = [&] {
    if (!have) return;
    have = false;
    std::string_view fv = field;
    std::size_t colon = fv.find(':');
    if (colon == std::string_view::npos) return;
    go_on = f(trim_blanks(fv.substr(0, colon)), trim_blanks(fv.substr(colon + 1)));
  };
  for (std::uint64_t pos = s; pos < e && go_on;) {
    Line line = read_line(file, pos, kFieldKeep);
    if (line.length == 0) break;
    std::string_view text = line.text.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(line.text.size(), e - pos)));
    pos += line.length;
    std::string_view body = line_body(text);
    if (body.empty()) break;  // the blank line ends the header
    if (is_blank(body.front())) {
      if (have && field.size() < kFieldKeep) field.append(body.substr(0, kFieldKeep - field.size()));
      continue;
    }
    flush();
    field.assign(body.substr(0, kFieldKeep));
    have = true;
  }
  if (go_on) flush();
}

// The first value of each of a few fields.
struct Fields {
  explicit Fields(std::initializer_list<std::string_view> names) : names_(names), values_(names.size()) {}
  void read(ByteSource& file, std::uint64_t s, std::uint64_t e) {
    each_field(file, s, e, [&](std::string_view name, std::string_view value) {
      for (std::size_t i = 0; i < names_.size(); ++i) {
        if (!values_[i] && str_iequals(name, names_[i])) values_[i] = std::string(value);
      }
      return true;
    });
  }
  const std::optional<std::string>& operator[](std::string_view name) const {
    static const std::optional<std::string> kNone;
    for (std::size_t i = 0; i < names_.size(); ++i) {
      if (names_[i] == name) return values_[i];
    }
    return kNone;
  }

 private:
  std::vector<std::string_view> names_;
  std::vector<std::optional<std::string>> values_;
};

// ---- MIME values ---------------------------------------------------------------------

bool is_tspecial(char c) {
  return std::string_view("()<>@,;:\\\"/[]?=").find(c) != std::string_view::npos;
}

class MimeValue {
 public:
  explicit MimeValue(std::string_view v) : v_(v) {}
  void skip_space() {
    for (;;) {
      while (i_ < v_.size() && (is_blank(v_[i_]) || v_[i_] == '\r' || v_[i_] == '\n')) ++i_;
      if (i_ >= v_.size() || v_[i_] != '(') return;
      int depth = 0;
      for (; i_ < v_.size(); ++i_) {
        // A backslash quotes the next byte, when there is one.
        if (v_[i_] == '\\') {
          if (i_ + 1 < v_.size()) ++i_;
          continue;
        }
        if (v_[i_] == '(') ++depth;
        if (v_[i_] == ')' && --depth == 0) {
          ++i_;
          break;
        }
      }
    }
  }
  bool eat(char c) {
    skip_space();
    if (i_ >= v_.size() || v_[i_] != c) return false;
    ++i_;
    return true;
  }
  // A token (8-bit bytes allowed, for careless parameter values).
  std::string token() {
    skip_space();
    std::size_t from = i_;
    while (i_ < v_.size()) {
      auto u = static_cast<unsigned char>(v_[i_]);
      if (u <= ' ' || u == 0x7f || is_tspecial(v_[i_])) break;
      ++i_;
    }
    return std::string(v_.substr(from, i_ - from));
  }
  std::optional<std::string> value() {
    skip_space();
    if (i_ >= v_.size() || v_[i_] != '"') {
      std::string t = token();
      if (t.empty()) return std::nullopt;
      return t;
    }
    std::string s;
    for (++i_; i_ < v_.size() && v_[i_] != '"'; ++i_) {
      if (v_[i_] == '\\' && i_ + 1 < v_.size()) ++i_;
      s += v_[i_];
    }
    if (i_ >= v_.size()) return std::nullopt;
    ++i_;
    return s;
  }

 private:
  std::string_view v_;
  std::size_t i_ = 0;
};

struct MediaType {
  std::string type, subtype;  // upper case
  std::vector<std::pair<std::string, std::string>> params;
};

std::optional<MediaType> parse_media(std::string_view value) {
  MimeValue v(value);
  MediaType mt;
  mt.type = upper(v.token());
  if (mt.type.empty() || !v.eat('/')) return std::nullopt;
  mt.subtype = upper(v.token());
  if (mt.subtype.empty()) return std::nullopt;
  while (mt.params.size() < 64 && v.eat(';')) {
    std::string name = upper(v.token());
    if (name.empty() || !v.eat('=')) break;
    std::optional<std::string> val = v.value();
    if (!val) break;
    mt.params.emplace_back(std::move(name), std::move(*val));
  }
  return mt;
}

MediaType default_media(bool in_digest) {
  if (in_digest) return {"MESSAGE", "RFC822", {}};
  return {"TEXT", "PLAIN", {{"CHARSET", "US-ASCII"}}};
}

void append_params(std::string& o, const std::vector<std::pair<std::string, std::string>>& params) {
  if (params.empty()) {
    o += "NIL";
    return;
  }
  o += '(';
  for (std::size_t i = 0; i < params.size(); ++i) {
    if (i) o += ' ';
    imap_append_string(o, params[i].first);
    o += ' ';
    imap_append_string(o, params[i].second);
  }
  o += ')';
}

std::optional<std::string_view> opt_view(const std::optional<std::string>& s) {
  if (!s) return std::nullopt;
  return std::string_view(*s);
}

void append_addresses(std::string& o, const std::vector<MailAddress>& list) {
  if (list.empty()) {
    o += "NIL";
    return;
  }
  o += '(';
  for (const MailAddress& a : list) {
    o += '(';
    imap_append_nstring(o, a.name.empty() ? std::nullopt : std::optional<std::string_view>(a.name));
    o += " NIL ";
    imap_append_string(o, a.mailbox);
    o += ' ';
    imap_append_string(o, a.host);
    o += ')';
  }
  o += ')';
}

std::string internal_date(std::time_t t) {
  static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                        "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  std::tm tm{};
  if (!localtime_r(&t, &tm) || tm.tm_year < -1900 || tm.tm_year > 9999 - 1900) {
    t = 0;
    gmtime_r(&t, &tm);
  }
  long zone = tm.tm_gmtoff / 60;
  return strprintf("\"%02d-%s-%04d %02d:%02d:%02d %c%02ld%02ld\"", tm.tm_mday, kMonths[tm.tm_mon], tm.tm_year + 1900,
                   tm.tm_hour, tm.tm_min, tm.tm_sec, zone < 0 ? '-' : '+', std::labs(zone) / 60, std::labs(zone) % 60);
}

// A header field name as the client wrote it: a plain one as an atom, any
// other quoted (a client that counts brackets is not misled).
void append_astring(std::string& o, std::string_view s) {
  bool atom = !s.empty() && std::all_of(s.begin(), s.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' || c == '_' ||
           c == '.';
  });
  if (atom) {
    o += s;
  } else {
    imap_append_string(o, s);
  }
}

// ---- one message --------------------------------------------------------------------

// Part of a section's content: stored bytes [s, e) of the file, or text.
struct Span {
  std::string text;
  bool is_text = false;
  std::uint64_t s = 0, e = 0;
  bool line_start = true;        // s begins a line
  std::uint64_t plain = kUnknown;  // its plain length, when known
};
using Content = std::vector<Span>;

// The tree of MIME parts: the records list them in order of appearance,
// each nested part after its container, one level deeper.
struct Tree {
  std::vector<const MimePart*> parts;
  std::vector<std::vector<std::size_t>> children;
  std::vector<std::size_t> top;
  std::vector<char> opaque;    // a multipart past the bounds: one body
  bool whole_opaque = false;   // the message's own body is one

  explicit Tree(const std::list<MimePart>& list) {
    std::vector<std::size_t> stack;
    parts.reserve(list.size());
    children.reserve(list.size());
    for (const MimePart& p : list) {
      std::size_t i = parts.size();
      parts.push_back(&p);
      children.emplace_back();
      while (!stack.empty() && parts[stack.back()]->level >= p.level) stack.pop_back();
      if (!stack.empty() && parts[stack.back()]->level == p.level - 1) {
        children[stack.back()].push_back(i);
      } else if (stack.empty() && p.level == 1) {
        top.push_back(i);
      }
      stack.push_back(i);
    }
    bound();
  }

  // Which multiparts are shown as one body: one nested too deep, and one
  // whose own parts would take the count past the limit (the parts are
  // counted level by level in order, a multipart's parts before what lies
  // below them). A message whose parts alone pass it is one body.
  void bound() {
    opaque.assign(parts.size(), 0);
    std::size_t shown = 0;
    std::function<bool(const std::vector<std::size_t>&, int)> expand = [&](const std::vector<std::size_t>& kids,
                                                                           int depth) {
      if (shown + kids.size() > kPartLimit) return false;
      shown += kids.size();
      for (std::size_t k : kids) {
        if (!children[k].empty() && (depth + 1 >= kDepthLimit || !expand(children[k], depth + 1))) opaque[k] = 1;
      }
      return true;
    };
    whole_opaque = !top.empty() && !expand(top, 0);
  }
  bool structured() const { return !top.empty() && !whole_opaque; }
};

// A message, or a message inside a message/rfc822 part: header [start, body),
// body [body, end).
struct Extent {
  std::uint64_t start = 0, body = 0, end = 0;
};

class Renderer {
 public:
  Renderer(ByteSource& file, MessageRecord& m, std::uint64_t offset)
      : f_(file), m_(m), tree_(m.parts) {
    std::uint64_t sep = m.total_length - m.length;
    std::uint64_t end_line = std::min<std::uint64_t>(m.end_line, m.length);
    msg_.start = offset + sep;
    msg_.end = offset + m.total_length - end_line;
    msg_.body = offset + std::clamp<std::uint64_t>(m.header_length, sep, m.total_length - end_line);
    stuffed_ = m.dots != 0;
    offset_ = offset;
  }

  // The length of the text a client is given.
  std::uint64_t size() const {
    std::uint64_t stored = m_.length - std::min<std::uint64_t>(m_.end_line, m_.length);
    return stored - std::min(m_.dots, stored);
  }

  void envelope(std::string& o, const Extent& x) {
    Fields h{"Date", "Subject", "From", "Sender", "Reply-To", "To", "Cc", "Bcc", "In-Reply-To", "Message-ID"};
    h.read(f_, x.start, x.body);
    auto list = [&](std::string_view name) {
      const auto& v = h[name];
      return v ? mail_address_list(*v) : std::vector<MailAddress>{};
    };
    std::vector<MailAddress> from = list("From"), sender = list("Sender"), reply_to = list("Reply-To");
    o += '(';
    imap_append_nstring(o, opt_view(h["Date"]));
    o += ' ';
    imap_append_nstring(o, opt_view(h["Subject"]));
    o += ' ';
    append_addresses(o, from);
    o += ' ';
    append_addresses(o, sender.empty() ? from : sender);
    o += ' ';
    append_addresses(o, reply_to.empty() ? from : reply_to);
    for (std::string_view name : {"To", "Cc", "Bcc"}) {
      o += ' ';
      append_addresses(o, list(name));
    }
    o += ' ';
    imap_append_nstring(o, opt_view(h["In-Reply-To"]));
    o += ' ';
    imap_append_nstring(o, opt_view(h["Message-ID"]));
    o += ')';
  }

  void structure(std::string& o, bool ext) {
    if (tree_.structured()) {
      multipart(o, tree_.top, msg_.start, msg_.body, ext, 0);
      return;
    }
    Span body = range(msg_.body, msg_.end);
    body.plain = body_plain();
    leaf(o, msg_.start, msg_.body, body, m_.body_lines, ext, 0, false, nullptr, tree_.whole_opaque);
  }

  const Extent& message() const { return msg_; }

  // The header's fields for SEARCH: values unfolded, encoded words decoded,
  // folded to one case; at most kSearchHeaderKeep of them in all.
  void header_fields(SearchText& t) {
    std::size_t kept = 0;
    each_field(f_, msg_.start, msg_.body, [&](std::string_view name, std::string_view value) {
      std::string decoded = header_words_decode(value);
      std::replace_if(decoded.begin(), decoded.end(), [](char c) { return c == '\r' || c == '\n'; }, ' ');
      t.fields.emplace_back(std::string(name), utf8_fold(decoded));
      kept += name.size() + value.size() + 4;
      return kept < kSearchHeaderKeep;
    });
    t.cost += kept;
  }

  // The body's text for SEARCH: its text parts (and attached messages) in
  // order, decoded, in UTF-8 and folded, up to `cap` bytes; the stored bytes
  // read are added to `read`.
  void body_text(std::string& out, std::size_t cap, std::uint64_t& read) {
    if (tree_.whole_opaque) return;
    if (tree_.top.empty()) {
      part_text(msg_.start, msg_.body, range(msg_.body, msg_.end), nullptr, out, cap, read);
      return;
    }
    std::function<void(const std::vector<std::size_t>&)> walk = [&](const std::vector<std::size_t>& kids) {
      for (std::size_t k : kids) {
        if (out.size() >= cap) return;
        if (!tree_.children[k].empty()) {
          if (!tree_.opaque[k]) walk(tree_.children[k]);
          continue;
        }
        const MimePart& p = *tree_.parts[k];
        auto [hs, he] = part_header(p);
        part_text(hs, he, part_body(p), &p, out, cap, read);
      }
    };
    walk(tree_.top);
  }

  // The content of a section; nullopt when the message has no such part.
  std::optional<Content> section(const FetchSection& sec) {
    using Kind = FetchSection::Kind;
    if (sec.part.empty()) return message_section(sec, msg_, true);
    if (!tree_.structured()) {  // a single part: part 1 is the body
      if (sec.part.size() != 1 || sec.part[0] != 1) return std::nullopt;
      if (sec.kind == Kind::mime) return Content{range(msg_.start, msg_.body)};
      if (sec.kind != Kind::all) return std::nullopt;
      Span body = range(msg_.body, msg_.end);
      body.plain = body_plain();
      return Content{body};
    }
    const std::vector<std::size_t>* level = &tree_.top;
    std::size_t node = 0;
    for (std::size_t i = 0; i < sec.part.size(); ++i) {
      if (sec.part[i] > level->size()) return std::nullopt;
      node = (*level)[sec.part[i] - 1];
      level = tree_.opaque[node] ? &kNoParts : &tree_.children[node];
    }
    auto [hs, he] = part_header(*tree_.parts[node]);
    Span body = part_body(*tree_.parts[node]);
    if (sec.kind == Kind::all) return Content{body};
    if (sec.kind == Kind::mime) {
      if (hs == he) return Content{text_span(part_header_text(*tree_.parts[node]))};
      return Content{range(hs, he)};
    }
    // HEADER, TEXT and the field lists reach into an attached message.
    std::optional<MediaType> mt = media_of(hs, he, *tree_.parts[node]);
    if (!mt || mt->type != "MESSAGE" || mt->subtype != "RFC822") return std::nullopt;
    return message_section(sec, inner(body), false);
  }

  // Plain length of the content.
  std::uint64_t plain(Span& sp) {
    if (sp.plain == kUnknown) {
      sp.plain = sp.is_text ? sp.text.size() : (sp.e - sp.s) - (stuffed_ ? dots_in(f_, sp.s, sp.e, sp.line_start) : 0);
    }
    return sp.plain;
  }

  // The plain bytes [a, b) of a span.
  Span cut(Span& sp, std::uint64_t a, std::uint64_t b) {
    Span c;
    if (sp.is_text) {
      c.is_text = true;
      c.text = sp.text.substr(static_cast<std::size_t>(a), static_cast<std::size_t>(b - a));
      return c;
    }
    c.plain = b - a;
    if (!stuffed_) {
      c.s = sp.s + a;
      c.e = sp.s + b;
      c.line_start = a == 0 && sp.line_start;
      return c;
    }
    // Walk the stored bytes to where plain byte a and plain byte b lie.
    std::uint64_t k = 0, pos = sp.s;
    bool at_start = sp.line_start;
    std::optional<std::uint64_t> s_at, e_at;
    each_piece(f_, sp.s, sp.e, [&](std::string_view v) {
      for (char ch : v) {
        if (!(at_start && ch == '.')) {  // plain byte number k
          if (k == a && !s_at) {
            s_at = pos;
            c.line_start = at_start;
          }
          if (k == b) {
            e_at = pos;
            return false;
          }
          ++k;
        }
        at_start = ch == '\n';
        ++pos;
      }
      return true;
    });
    c.e = e_at.value_or(sp.e);
    c.s = s_at.value_or(c.e);
    return c;
  }

  void emit(const Span& sp, ImapSink& out) {
    if (sp.is_text) {
      out.text(sp.text);
      return;
    }
    if (sp.e <= sp.s) return;
    if (!stuffed_) {
      out.file_range(sp.s, sp.e - sp.s, false);
      return;
    }
    std::uint64_t from = sp.s;
    if (!sp.line_start) {  // up to the next line start as it is
      std::uint64_t lf = sp.e;
      std::uint64_t pos = sp.s;
      each_piece(f_, sp.s, sp.e, [&](std::string_view v) {
        std::size_t at = v.find('\n');
        if (at != std::string_view::npos) lf = pos + at + 1;
        pos += v.size();
        return at == std::string_view::npos;
      });
      out.file_range(sp.s, lf - sp.s, false);
      from = lf;
    }
    if (from < sp.e) out.file_range(from, sp.e - from, true);
  }

 private:
  Span range(std::uint64_t s, std::uint64_t e, bool line_start = true) {
    Span sp;
    sp.s = s;
    sp.e = std::max(s, e);
    sp.line_start = line_start;
    return sp;
  }
  static Span text_span(std::string t) {
    Span sp;
    sp.is_text = true;
    sp.text = std::move(t);
    return sp;
  }

  // The plain length of the message's body: all but the header's dots.
  std::uint64_t body_plain() {
    std::uint64_t header_dots = stuffed_ ? dots_in(f_, msg_.start, msg_.body, true) : 0;
    std::uint64_t dots = m_.dots - std::min(header_dots, m_.dots);
    return (msg_.end - msg_.body) - std::min(dots, msg_.end - msg_.body);
  }

  std::optional<Content> message_section(const FetchSection& sec, const Extent& x, bool whole) {
    using Kind = FetchSection::Kind;
    switch (sec.kind) {
      case Kind::all: {
        Span sp = range(x.start, x.end);
        if (whole) sp.plain = size();
        return Content{sp};
      }
      case Kind::header:
        return Content{range(x.start, x.body)};
      case Kind::text: {
        Span sp = range(x.body, x.end);
        if (whole) sp.plain = body_plain();
        return Content{sp};
      }
      case Kind::fields:
      case Kind::fields_not:
        return fields(x, sec.fields, sec.kind == Kind::fields_not);
      case Kind::mime:
        break;
    }
    return std::nullopt;
  }

  // The header lines of the fields named (or, with `invert`, of all the
  // others), continuation lines with them, and the blank line. Field lines
  // never start with a dot, so their stored bytes are what is sent.
  Content fields(const Extent& x, const std::vector<std::string>& names, bool invert) {
    Content c;
    bool selected = false;
    for (std::uint64_t pos = x.start; pos < x.body;) {
      Line line = read_line(f_, pos, 1024);
      if (line.length == 0) break;
      std::string_view body = line_body(line.text);
      if (body.empty()) break;  // the blank line ends the header
      std::uint64_t len = std::min(line.length, x.body - pos);
      if (!is_blank(body.front())) {  // a field starts (continuations go with it)
        std::size_t colon = body.find(':');
        selected = false;
        if (colon != std::string_view::npos && body.front() != '.') {
          std::string_view name = trim_blanks(body.substr(0, colon));
          bool named = std::any_of(names.begin(), names.end(), [&](const std::string& n) { return str_iequals(n, name); });
          selected = named != invert;
        }
      }
      if (selected) {
        if (!c.empty() && c.back().e == pos) {
          c.back().e += len;
        } else {
          c.push_back(range(pos, pos + len));
        }
        c.back().plain = c.back().e - c.back().s;
      }
      pos += line.length;
    }
    c.push_back(text_span("\r\n"));
    return c;
  }

  // A part's stored body: its range within the message body, without the
  // line end before the delimiter that follows it (that line end belongs to
  // the delimiter).
  Span part_body(const MimePart& p) {
    std::uint64_t s = std::clamp<std::uint64_t>(offset_ + p.body_offset, msg_.body, msg_.end);
    std::uint64_t e = std::clamp<std::uint64_t>(s + p.length, s, msg_.end);
    if (e < msg_.end && e > s) {
      std::uint64_t from = e - std::min<std::uint64_t>(2, e - s);
      std::string_view tail = f_.view(from, 2);
      tail = tail.substr(0, std::min<std::size_t>(tail.size(), static_cast<std::size_t>(e - from)));
      if (tail == "\r\n") {
        e -= 2;
      } else if (!tail.empty() && tail.back() == '\n') {
        e -= 1;
      }
    }
    return range(s, e);
  }

  // A part's header: the lines between its delimiter line and its body.
  // [he, he) when it cannot be found.
  std::pair<std::uint64_t, std::uint64_t> part_header(const MimePart& p) {
    std::uint64_t he = std::clamp<std::uint64_t>(offset_ + p.body_offset, msg_.body, msg_.end);
    std::uint64_t from = he - std::min(he - msg_.body, kPartHeaderWindow);
    std::string_view w = f_.view(from, static_cast<std::size_t>(he - from));
    w = w.substr(0, std::min<std::size_t>(w.size(), static_cast<std::size_t>(he - from)));
    // The last line in the window that starts with "--" and ends before the body.
    for (std::size_t i = w.size(); i-- > 0;) {
      bool line_start = i == 0 ? from == msg_.body : w[i - 1] == '\n';
      if (!line_start || w.compare(i, 2, "--") != 0) continue;
      std::size_t lf = w.find('\n', i);
      if (lf == std::string_view::npos) continue;
      return {from + lf + 1, he};
    }
    return {he, he};
  }

  // A header made of what the record knows, for a part whose own header
  // could not be found.
  static std::string part_header_text(const MimePart& p) {
    std::string h;
    if (!p.content_type.empty()) h += "Content-Type: " + p.content_type + "\r\n";
    if (!p.content_id.empty()) h += "Content-ID: " + p.content_id + "\r\n";
    if (!p.description.empty()) h += "Content-Description: " + p.description + "\r\n";
    return h + "\r\n";
  }

  // A part's header fields [hs, he); where its header could not be found,
  // what the record knows of it.
  void part_fields(Fields& h, std::uint64_t hs, std::uint64_t he, const MimePart* record) {
    if (hs == he && record) {
      std::string made = part_header_text(*record);
      TextSource t(made);
      h.read(t, 0, t.size());
    } else {
      h.read(f_, hs, he);
    }
  }

  // One part's text (see body_text); a part that is not text adds nothing.
  void part_text(std::uint64_t hs, std::uint64_t he, const Span& body, const MimePart* record, std::string& out,
                 std::size_t cap, std::uint64_t& read) {
    Fields h{"Content-Type", "Content-Transfer-Encoding"};
    part_fields(h, hs, he, record);
    std::optional<MediaType> mt = h["Content-Type"] ? parse_media(*h["Content-Type"]) : std::nullopt;
    // (A multipart reaches here only when its parts could not be told apart.)
    if (mt && mt->type != "TEXT" && mt->type != "MESSAGE" && mt->type != "MULTIPART") return;
    std::string charset;
    for (const auto& [name, value] : mt ? mt->params : std::vector<std::pair<std::string, std::string>>{})
      if (name == "CHARSET") charset = value;
    const auto& encoding = h["Content-Transfer-Encoding"];
    TransferDecoder decoder(encoding ? transfer_kind(MimeValue(*encoding).token()) : TransferDecoder::Kind::identity);
    const std::size_t room = cap - std::min(cap, out.size());
    std::string raw, plain;
    bool at_start = body.line_start;
    each_piece(f_, body.s, body.e, [&](std::string_view v) {
      read += v.size();
      if (stuffed_) {
        plain.clear();
        for (char c : v) {
          if (!(at_start && c == '.')) plain += c;
          at_start = c == '\n';
        }
        v = plain;
      }
      decoder.feed(v, raw);
      return raw.size() < room;
    });
    decoder.finish(raw);
    raw.resize(std::min(raw.size(), room));
    std::string text;
    charset_to_utf8(charset, raw, text);
    utf8_fold_append(out, text);
    if (out.size() > cap) out.resize(cap);
    out += '\n';
  }

  std::optional<MediaType> media_of(std::uint64_t hs, std::uint64_t he, const MimePart& p) {
    if (hs == he) return parse_media(p.content_type);
    Fields h{"Content-Type"};
    h.read(f_, hs, he);
    return h["Content-Type"] ? parse_media(*h["Content-Type"]) : std::nullopt;
  }

  // The message inside a message/rfc822 part.
  Extent inner(const Span& body) {
    Extent x{body.s, body.e, body.e};
    for (std::uint64_t pos = body.s; pos < body.e;) {
      Line line = read_line(f_, pos, 16);
      if (line.length == 0) break;
      pos += line.length;
      if (line_body(line.text).empty()) {
        x.body = std::min(pos, body.e);
        break;
      }
    }
    return x;
  }

  void multipart(std::string& o, const std::vector<std::size_t>& kids, std::uint64_t hs, std::uint64_t he, bool ext,
                 int depth) {
    Fields h{"Content-Type"};
    h.read(f_, hs, he);
    std::optional<MediaType> mt = h["Content-Type"] ? parse_media(*h["Content-Type"]) : std::nullopt;
    bool digest = mt && mt->subtype == "DIGEST";
    o += '(';
    for (std::size_t k : kids) {
      const MimePart& p = *tree_.parts[k];
      auto [phs, phe] = part_header(p);
      if (!tree_.children[k].empty() && !tree_.opaque[k]) {
        multipart(o, tree_.children[k], phs, phe, ext, depth + 1);
      } else {
        leaf(o, phs, phe, part_body(p), p.lines, ext, depth + 1, digest, &p, tree_.opaque[k] != 0);
      }
    }
    o += ' ';
    imap_append_string(o, mt && mt->type == "MULTIPART" ? mt->subtype : "MIXED");
    if (ext) {
      o += ' ';
      append_params(o, mt ? mt->params : std::vector<std::pair<std::string, std::string>>{});
      o += " NIL NIL";
    }
    o += ')';
  }

  void leaf(std::string& o, std::uint64_t hs, std::uint64_t he, Span body, std::uint64_t lines, bool ext, int depth,
            bool in_digest, const MimePart* record = nullptr, bool opaque = false) {
    Fields h{"Content-Type", "Content-ID", "Content-Description", "Content-Transfer-Encoding"};
    part_fields(h, hs, he, record);
    std::optional<MediaType> parsed = h["Content-Type"] ? parse_media(*h["Content-Type"]) : std::nullopt;
    MediaType mt = parsed ? *parsed : default_media(in_digest);
    bool message = mt.type == "MESSAGE" && mt.subtype == "RFC822";
    if (opaque || (message && depth + 1 >= kDepthLimit)) mt = {"APPLICATION", "OCTET-STREAM", {}};
    message = message && !opaque && depth + 1 < kDepthLimit;
    std::string encoding = "7BIT";
    if (h["Content-Transfer-Encoding"]) {
      std::string token = upper(MimeValue(*h["Content-Transfer-Encoding"]).token());
      if (!token.empty()) encoding = token;
    }
    o += '(';
    imap_append_string(o, mt.type);
    o += ' ';
    imap_append_string(o, mt.subtype);
    o += ' ';
    append_params(o, mt.params);
    o += ' ';
    imap_append_nstring(o, opt_view(h["Content-ID"]));
    o += ' ';
    imap_append_nstring(o, opt_view(h["Content-Description"]));
    o += ' ';
    imap_append_string(o, encoding);
    strappendf(o, " %llu", static_cast<unsigned long long>(plain(body)));
    if (message) {
      Extent x = inner(body);
      o += ' ';
      envelope(o, x);
      o += ' ';
      Span inner_body = range(x.body, x.end);
      leaf(o, x.start, x.body, inner_body, kUnknown, ext, depth + 1, false);
    }
    if (message || mt.type == "TEXT") {
      if (lines == kUnknown) lines = lines_in(f_, body.s, body.e);
      strappendf(o, " %llu", static_cast<unsigned long long>(lines));
    }
    if (ext) o += " NIL NIL NIL";
    o += ')';
  }

  ByteSource& f_;
  MessageRecord& m_;
  Tree tree_;
  Extent msg_;
  std::uint64_t offset_ = 0;
  bool stuffed_ = false;
};

void append_section_name(std::string& o, const FetchItem& it) {
  using Kind = FetchSection::Kind;
  switch (it.name) {
    case FetchItem::Name::rfc822:
      o += "RFC822";
      return;
    case FetchItem::Name::rfc822_header:
      o += "RFC822.HEADER";
      return;
    case FetchItem::Name::rfc822_text:
      o += "RFC822.TEXT";
      return;
    case FetchItem::Name::body:
      break;
  }
  o += "BODY[";
  const FetchSection& s = it.section;
  for (std::size_t i = 0; i < s.part.size(); ++i) {
    if (i) o += '.';
    o += std::to_string(s.part[i]);
  }
  if (!s.part.empty() && s.kind != Kind::all) o += '.';
  switch (s.kind) {
    case Kind::all:
      break;
    case Kind::header:
      o += "HEADER";
      break;
    case Kind::text:
      o += "TEXT";
      break;
    case Kind::mime:
      o += "MIME";
      break;
    case Kind::fields:
    case Kind::fields_not:
      o += s.kind == Kind::fields ? "HEADER.FIELDS (" : "HEADER.FIELDS.NOT (";
      for (std::size_t i = 0; i < s.fields.size(); ++i) {
        if (i) o += ' ';
        append_astring(o, s.fields[i]);
      }
      o += ')';
      break;
  }
  o += ']';
  if (it.partial) o += "<" + std::to_string(it.start) + ">";
}

// Text is gathered and handed on in one piece before each file range.
class Output {
 public:
  explicit Output(ImapSink& sink) : sink_(sink) {}
  std::string& text() { return buf_; }
  ImapSink& flushed() {
    flush();
    return sink_;
  }
  void flush() {
    if (!buf_.empty()) sink_.text(buf_);
    buf_.clear();
  }

 private:
  ImapSink& sink_;
  std::string buf_;
};

}  // namespace

// ---- ImapBuffer -----------------------------------------------------------------------

void ImapBuffer::text(std::string_view bytes) {
  if (bytes.empty()) return;
  if (pieces_.empty() || pieces_.back().is_range) pieces_.emplace_back();
  pieces_.back().text.append(bytes);
}

void ImapBuffer::file_range(std::uint64_t offset, std::uint64_t length, bool unstuff) {
  if (length == 0) return;
  Piece& p = pieces_.emplace_back();
  p.is_range = true;
  p.offset = offset;
  p.length = length;
  p.unstuff = unstuff;
}

void ImapBuffer::replay(ImapSink& to) const {
  for (const Piece& p : pieces_) {
    if (p.is_range) {
      to.file_range(p.offset, p.length, p.unstuff);
    } else {
      to.text(p.text);
    }
  }
}

std::optional<std::string> ImapBuffer::flatten(ByteSource& file) const {
  std::string out;
  for (const Piece& p : pieces_) {
    if (!p.is_range) {
      out += p.text;
    } else if (p.length > file.size() || p.offset > file.size() - p.length ||
               !append_plain(file, p.offset, p.offset + p.length, p.unstuff, true, out)) {
      return std::nullopt;
    }
  }
  if (file.failed()) return std::nullopt;
  return out;
}

void ImapBuffer::clear() { pieces_.clear(); }

bool imap_unstuff_append(ByteSource& file, std::uint64_t offset, std::uint64_t length, std::string& out) {
  if (length > file.size() || offset > file.size() - length) return false;
  return append_plain(file, offset, offset + length, true, true, out) && !file.failed();
}

// ---- strings and flags ------------------------------------------------------------------

void imap_append_string(std::string& out, std::string_view text) {
  bool quoted = std::none_of(text.begin(), text.end(), [](char c) {
    auto u = static_cast<unsigned char>(c);
    return u == 0 || u == '\r' || u == '\n' || u >= 0x80;
  });
  if (!quoted) {
    strappendf(out, "{%zu}\r\n", text.size());
    out += text;
    return;
  }
  out += '"';
  for (char c : text) {
    if (c == '"' || c == '\\') out += '\\';
    out += c;
  }
  out += '"';
}

void imap_append_nstring(std::string& out, std::optional<std::string_view> text) {
  if (text) {
    imap_append_string(out, *text);
  } else {
    out += "NIL";
  }
}

namespace {
const struct {
  const char* name;
  std::uint32_t bit;
} kFlagNames[] = {{"\\Seen", msgflag::seen},       {"\\Answered", msgflag::answered}, {"\\Flagged", msgflag::flagged},
                  {"\\Deleted", msgflag::deleted}, {"\\Draft", msgflag::draft},       {"\\Recent", msgflag::recent}};
}

std::string imap_flag_list(std::uint32_t flags) {
  std::string o = "(";
  for (const auto& f : kFlagNames) {
    if (!(flags & f.bit)) continue;
    if (o.size() > 1) o += ' ';
    o += f.name;
  }
  return o + ")";
}

std::uint32_t imap_flag_bit(std::string_view name) {
  for (const auto& f : kFlagNames) {
    if (f.bit != msgflag::recent && str_iequals(name, f.name)) return f.bit;
  }
  return 0;
}

// ---- rendering ------------------------------------------------------------------------------

FetchResult imap_fetch_render(const FetchRequest& request, FetchTarget& target, ByteSource& file,
                              const FetchOptions& options, ImapSink& sink) {
  FetchResult result;
  MessageRecord& m = target.message;
  if (!within(file, m, target.offset)) return {FetchStatus::unreadable, false};
  bool needs_text = std::any_of(request.items.begin(), request.items.end(), [](const FetchItem& it) {
    return it.att == FetchAtt::rfc822_size || it.att == FetchAtt::body || it.att == FetchAtt::bodystructure ||
           it.att == FetchAtt::section;
  });
  if (needs_text && !count_text(file, m, target.offset)) return {FetchStatus::unreadable, false};
  Renderer r(file, m, target.offset);

  result.seen_set = options.may_set_seen && request.sets_seen() && !(target.flags & msgflag::seen);
  std::uint32_t flags = target.flags | (result.seen_set ? msgflag::seen : 0);
  bool uid_shown = false, flags_shown = false, bodyish = false;

  Output out(sink);
  strappendf(out.text(), "* %u FETCH (", target.sequence);
  bool first = true;
  for (const FetchItem& it : request.items) {
    std::string& o = out.text();
    if (!first) o += ' ';
    first = false;
    switch (it.att) {
      case FetchAtt::flags:
        o += "FLAGS " + imap_flag_list(flags);
        flags_shown = true;
        break;
      case FetchAtt::internaldate:
        o += "INTERNALDATE " + internal_date(m.internal_date);
        break;
      case FetchAtt::rfc822_size:
        strappendf(o, "RFC822.SIZE %llu", static_cast<unsigned long long>(r.size()));
        break;
      case FetchAtt::envelope:
        o += "ENVELOPE ";
        r.envelope(o, r.message());
        break;
      case FetchAtt::body:
      case FetchAtt::bodystructure:
        o += it.att == FetchAtt::body ? "BODY " : "BODYSTRUCTURE ";
        r.structure(o, it.att == FetchAtt::bodystructure);
        bodyish = true;
        break;
      case FetchAtt::uid:
        strappendf(o, "UID %u", m.uid);
        uid_shown = true;
        break;
      case FetchAtt::section: {
        bodyish = true;
        append_section_name(o, it);
        std::optional<Content> c = r.section(it.section);
        if (!c) {
          o += " {0}\r\n";
          break;
        }
        std::uint64_t total = 0;
        for (Span& sp : *c) total += r.plain(sp);
        if (it.partial) {
          // The plain bytes [start, start + count) of the concatenation.
          std::uint64_t a = std::min<std::uint64_t>(it.start, total);
          std::uint64_t b = std::min<std::uint64_t>(a + it.count, total);
          Content cut;
          std::uint64_t at = 0;
          for (Span& sp : *c) {
            std::uint64_t len = r.plain(sp);
            std::uint64_t lo = std::max(a, at), hi = std::min(b, at + len);
            if (lo < hi) cut.push_back(r.cut(sp, lo - at, hi - at));
            at += len;
          }
          *c = std::move(cut);
          total = b - a;
        }
        strappendf(o, " {%llu}\r\n", static_cast<unsigned long long>(total));
        for (const Span& sp : *c) {
          if (sp.is_text) {
            out.text() += sp.text;
          } else {
            r.emit(sp, out.flushed());
          }
        }
        break;
      }
    }
  }
  std::string& o = out.text();
  if (!uid_shown && (options.uid_mode || bodyish)) strappendf(o, " UID %u", m.uid);
  if (result.seen_set && !flags_shown) o += " FLAGS " + imap_flag_list(flags);
  o += ")\r\n";
  out.flush();
  if (file.failed()) result.status = FetchStatus::unreadable;
  return result;
}

// ---- search ------------------------------------------------------------------------------------

std::optional<std::uint64_t> imap_message_size(ByteSource& file, MessageRecord& message, std::uint64_t offset) {
  if (!within(file, message, offset) || !count_text(file, message, offset)) return std::nullopt;
  return Renderer(file, message, offset).size();
}

bool imap_search_text(ByteSource& file, MessageRecord& message, std::uint64_t offset, bool with_body,
                      SearchText& out) {
  if (!within(file, message, offset) || !count_text(file, message, offset)) return false;
  Renderer r(file, message, offset);
  if (!out.header_read) {
    r.header_fields(out);
    out.header_read = true;
  }
  if (with_body && !out.body_read) {
    r.body_text(out.body, kSearchBodyKeep, out.cost);
    out.cost += out.body.size();
    out.body_read = true;
  }
  return !file.failed();
}

}  // namespace velmor
