// Mailbox files, their overview index and the in-memory mailbox cache.
#include "mail/mailbox.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <vector>

#include "core/filecache.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/safedir.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/mailfile.h"

namespace velmor {

namespace {

std::list<Mailbox> g_boxes;  // lives as long as the process

std::time_t now() { return server_now ? server_now : std::time(nullptr); }

// ---- files below the home ---------------------------------------------------

// The home of a mailbox path when none is given: the folder above "mail".
std::string home_of(const std::string& path) { return std::string(path_dir(path_dir(path))); }

// A path below the home, relative to it; "" (which opens nothing) for a
// path that is not below it.
std::string below_home(const std::string& home, std::string_view path) {
  if (!home.empty()) {
    if (path.substr(0, home.size()) != home) return {};
    path.remove_prefix(home.size());
    if (home.back() != '/' && !path.empty() && path.front() != '/') return {};
  }
  while (!path.empty() && path.front() == '/') path.remove_prefix(1);
  return std::string(path);
}

void log_refusal(const std::string& home, const SafeResult& r) {
  if (r.refused()) log_write("Mailbox refused: " + safe_describe(home, r), logchan::errors);
}

// A file below a home, opened without following links (refusals logged).
SafeResult open_below(const std::string& home, std::string_view path, int flags, UniqueFd& fd) {
  SafeDir root;
  SafeResult r = SafeDir::open_root(home, root);
  if (r.ok()) r = root.open_file(below_home(home, path), flags, fd);
  log_refusal(home, r);
  return r;
}

// The folder that holds `path`, below a home; made when missing if `create`.
SafeResult open_folder_of(const std::string& home, std::string_view path, bool create, SafeDir& dir) {
  SafeDir root;
  SafeResult r = SafeDir::open_root(home, root);
  if (r.ok()) r = root.open_dir(path_dir(below_home(home, path)), create, dir);
  log_refusal(home, r);
  return r;
}


bool is_blank(char c) { return c == ' ' || c == '\t'; }

bool is_empty_line(std::string_view text) { return text == "\r\n" || text == "\n"; }

// A header value: the text after the colon, leading blanks skipped.
std::string_view value_after_colon(std::string_view header) {
  std::size_t colon = header.find(':');
  if (colon == std::string_view::npos) return {};
  std::string_view v = header.substr(colon + 1);
  while (!v.empty() && is_blank(v.front())) v.remove_prefix(1);
  return v;
}

// The first line of a (possibly folded) header value, without CR and LF.
std::string first_line_value(std::string_view header) {
  return std::string(line_cut(value_after_colon(header)));
}

// The folded value joined, for searching (CR and LF kept).
std::string_view whole_value(std::string_view header) { return value_after_colon(header); }

// "boundary=" of a Content-Type value: without a leading quote, up to a
// quote, ";", CR or LF, at most 72 characters.
std::string boundary_of(std::string_view content_type) {
  auto at = str_casestr(content_type, "boundary=");
  if (!at) return {};
  std::string_view v = content_type.substr(*at + 9);
  if (!v.empty() && v.front() == '"') v.remove_prefix(1);
  std::size_t end = v.find_first_of("\";\r\n");
  v = v.substr(0, std::min<std::size_t>(end, 72));
  while (!v.empty() && is_blank(v.back())) v.remove_suffix(1);
  return std::string(v);
}

int encoding_code(std::string_view value) {
  value = trim_blanks(line_cut(value));
  if (str_istarts_with(value, "base64")) return 3;
  if (str_istarts_with(value, "quoted-printable")) return 4;
  return 0;
}

std::uint32_t parse_u32(std::string_view text) {
  std::uint32_t v = 0;
  while (!text.empty() && is_blank(text.front())) text.remove_prefix(1);
  std::from_chars(text.data(), text.data() + text.size(), v);
  return v;
}

// Collects header lines, joining folded continuations, each kept to a
// bounded size so a hostile header cannot exhaust memory.
constexpr std::size_t kHeaderKeep = 16 * 1024;

void append_bounded(std::string& to, std::string_view text) {
  if (to.size() < kHeaderKeep) to.append(text.substr(0, kHeaderKeep - to.size()));
}

struct Boundary {
  std::string text;
  int level = 1;
  int next_number = 1;
};

// The MIME structure of one message, built while its lines are scanned.
class MimeScanner {
 public:
  MimeScanner(std::list<MimePart>& parts, std::string boundary) : parts_(parts) {
    stack_.push_back({std::move(boundary), 1, 1});
  }

  // One line of the body at `rel` (offset from the message start).
  void line(std::string_view text, std::uint64_t rel, std::uint64_t length) {
    if (done_) return;
    if (text.size() > 2 && text[0] == '-' && text[1] == '-') {
      std::string_view rest = text.substr(2);
      for (std::size_t i = 0; i < stack_.size(); ++i) {
        const std::string& b = stack_[i].text;
        if (b.empty() || rest.substr(0, b.size()) != b) continue;
        std::string_view after = rest.substr(b.size());
        bool closing = after.substr(0, 2) == "--";
        if (!closing && !after.empty() && after.front() != '\r' && after.front() != '\n' &&
            !is_blank(after.front())) {
          continue;  // a longer boundary that merely starts the same way
        }
        delimiter(i, closing, rel, length);
        return;
      }
    }
    if (in_part_header_) {
      part_header_line(text, rel + length);
      return;
    }
    for (auto& open : open_) ++open.part->lines;
  }

  void finish(std::uint64_t message_end) {
    for (auto& open : open_) open.part->length = static_cast<std::uint32_t>(message_end - open.part->body_offset);
    if (in_part_header_ && current_) current_->body_offset = static_cast<std::uint32_t>(message_end);
    open_.clear();
  }

 private:
  struct Open {
    MimePart* part;
    int level;
  };

  void close_from_level(int level, std::uint64_t rel) {
    flush_header();
    while (!open_.empty() && open_.back().level >= level) {
      MimePart* p = open_.back().part;
      p->length = rel > p->body_offset ? static_cast<std::uint32_t>(rel - p->body_offset) : 0;
      open_.pop_back();
    }
  }

  void delimiter(std::size_t index, bool closing, std::uint64_t rel, std::uint64_t length) {
    Boundary& b = stack_[index];
    close_from_level(b.level, rel);
    stack_.resize(index + 1);
    if (closing) {
      stack_.pop_back();
      if (stack_.empty()) done_ = true;
      in_part_header_ = false;
      current_ = nullptr;
      return;
    }
    MimePart& part = parts_.emplace_back();
    part.level = b.level;
    part.number = b.next_number++;
    part.body_offset = static_cast<std::uint32_t>(rel + length);
    current_ = &part;
    in_part_header_ = true;
    header_.clear();
  }

  void part_header_line(std::string_view text, std::uint64_t next_rel) {
    if (is_empty_line(text)) {
      flush_header();
      in_part_header_ = false;
      current_->body_offset = static_cast<std::uint32_t>(next_rel);
      open_.push_back({current_, current_->level});
      if (!pending_boundary_.empty()) {
        stack_.push_back({std::move(pending_boundary_), current_->level + 1, 1});
        pending_boundary_.clear();
      }
      return;
    }
    if (is_blank(text.front()) && !header_.empty()) {
      append_bounded(header_, text);
      return;
    }
    flush_header();
    append_bounded(header_, text);
  }

  void flush_header() {
    if (header_.empty() || !current_) return;
    std::string_view h = header_;
    if (str_istarts_with(h, "content-type:")) {
      current_->content_type = first_line_value(h);
      if (str_istarts_with(current_->content_type, "multipart")) pending_boundary_ = boundary_of(h);
    } else if (str_istarts_with(h, "content-id:")) {
      current_->content_id = first_line_value(h);
    } else if (str_istarts_with(h, "content-description:")) {
      current_->description = first_line_value(h);
    } else if (str_istarts_with(h, "content-transfer-encoding:")) {
      current_->encoding = encoding_code(value_after_colon(h));
    }
    header_.clear();
  }

  std::list<MimePart>& parts_;
  std::vector<Boundary> stack_;
  std::vector<Open> open_;
  MimePart* current_ = nullptr;
  bool in_part_header_ = false;
  bool done_ = false;
  std::string header_;
  std::string pending_boundary_;
};

void recount(Mailbox& box) {
  box.count = 0;
  box.unseen = 0;
  for (const auto& m : box.messages) {
    ++box.count;
    if (!(m.flags & msgflag::seen)) ++box.unseen;
  }
}

std::uint64_t parse_all(Mailbox& box, ByteSource& in, std::uint64_t from) {
  std::uint64_t off = from;
  while (off != kNoMessage && off < in.size()) off = mailbox_parse_message(in, off, box);
  return off;
}

void reset(Mailbox& box) {
  box.messages.clear();
  box.count = box.unseen = 0;
  box.loaded = now();
}

// Parses the whole mailbox file again and writes a fresh overview. The next
// identifier never goes down, so a client that remembers identifiers never
// sees one reused.
void rebuild(Mailbox& box, ByteSource& in) {
  std::uint32_t next = std::max<std::uint32_t>(box.next_uid, 1);
  reset(box);
  box.next_uid = 1;
  parse_all(box, in, 0);
  box.next_uid = std::max(box.next_uid, next);
  recount(box);
  mailbox_overview_write(box);
}

bool newer(const struct timespec& a, const struct timespec& b) {
  return a.tv_sec > b.tv_sec || (a.tv_sec == b.tv_sec && a.tv_nsec > b.tv_nsec);
}

// Whole messages from `from` to the end: a separator line first, the "."
// line that ends a message last.
bool whole_messages(ByteSource& in, std::uint64_t from) {
  if (in.size() < from + 5) return false;
  if (mailbox_separator_date(read_line(in, from, 1024).text) == kBadDate) return false;
  return in.view(in.size() - 5, 5).substr(0, 5) == "\r\n.\r\n";
}

// Cuts the mailbox back to `length`, unless it was replaced since `seen`
// was taken of it.
void cut_back(const Mailbox& box, const struct stat& seen, std::uint64_t length) {
  UniqueFd fd;
  if (!open_below(box.home, box.path, O_WRONLY, fd).ok()) return;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0 || st.st_ino != seen.st_ino || st.st_dev != seen.st_dev) return;
  int rc = sysio::ftruncate(fd.get(), static_cast<off_t>(length)) == 0 && sysio::fsync(fd.get()) == 0 ? 0 : errno;
  log_write(strprintf("Mailbox %s cut back to its last whole message, %llu bytes dropped%s", box.path.c_str(),
                      static_cast<unsigned long long>(static_cast<std::uint64_t>(st.st_size) - length),
                      rc ? (": " + error_text(rc)).c_str() : ""),
            logchan::errors);
}

// Brings a record in line with its file. A file longer than the records
// holds either whole messages added behind our back, which are parsed, or
// what an interrupted append left, which is cut off so that no later
// message is glued to it. A file that shrank is read again unless a
// session is using it (its message numbers must not move under it).
void settle(Mailbox& box, FileSource& in, const struct stat& st) {
  std::uint64_t known = mailbox_size(box);
  if (in.size() == known) return;
  if (in.size() < known) {
    if (!(box.flags & boxflag::in_use)) rebuild(box, in);
  } else if (whole_messages(in, known)) {
    parse_all(box, in, known);
    recount(box);
    mailbox_overview_write(box);
  } else {
    cut_back(box, st, known);
  }
}

// Reads the overview file; 0 and its time of writing, or non-zero.
int read_overview(Mailbox& box, struct timespec& written) {
  UniqueFd fd;
  if (!open_below(box.home, mailbox_overview_path(box.path), O_RDONLY, fd).ok()) return 1;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return 1;
  written = st.st_mtim;
  FileSource in(std::move(fd));
  std::string_view text = in.view(0, static_cast<std::size_t>(in.size()));
  if (text.size() != in.size()) return 1;
  return mailbox_overview_parse(box, text);
}

}  // namespace

// ---- format -----------------------------------------------------------------

std::string mailbox_separator(std::string_view envelope_line, std::time_t when) {
  std::string sender = "unknown";
  std::size_t lt = envelope_line.find('<');
  if (lt != std::string_view::npos) {
    std::string_view s = envelope_line.substr(lt + 1);
    s = s.substr(0, s.find_first_of(">\r\n"));
    if (!s.empty()) {
      // The sender is one word of the separator: blanks would move the date.
      sender.assign(s);
      for (char& c : sender) {
        if (static_cast<unsigned char>(c) <= ' ' || c == 0x7f) c = '_';
      }
    }
  }
  std::tm tm{};
  localtime_r(&when, &tm);
  char date[64];
  std::strftime(date, sizeof date, " %a %b %d %H:%M:%S %Y\r\n", &tm);
  return "From " + sender + date;
}

std::time_t mailbox_separator_date(std::string_view line) {
  if (!str_istarts_with(line, "From ")) return kBadDate;
  std::string_view rest = line.substr(5);
  while (!rest.empty() && is_blank(rest.front())) rest.remove_prefix(1);
  std::size_t end = rest.find_first_of(" \t");
  if (end == std::string_view::npos) return kBadDate;
  rest.remove_prefix(end);
  rest = trim_blanks(line_body(rest));
  if (rest.empty()) return kBadDate;
  std::time_t t = parse_date(rest);
  if (t != kBadDate) return t;
  // Our own form, should the general parser not know it.
  std::string text(rest);
  std::tm tm{};
  const char* end_parse = strptime(text.c_str(), "%a %b %d %H:%M:%S %Y", &tm);
  if (!end_parse) return kBadDate;
  tm.tm_isdst = -1;
  return std::mktime(&tm);
}

bool mailbox_header_dropped(std::string_view line) {
  // Our own state travels in these headers; arriving mail must not set it.
  return str_istarts_with(line, "Status:") || str_istarts_with(line, "From ") || str_istarts_with(line, "X-UID:") ||
         str_istarts_with(line, "X-UIDL:") || str_istarts_with(line, "X-Status:") || str_istarts_with(line, "X-RCPT-TO:");
}

std::string mailbox_box_for_address(std::string_view address) {
  while (!address.empty() && (address.front() == '<' || address.front() == ':' || is_blank(address.front()))) {
    address.remove_prefix(1);
  }
  std::string_view local = address.substr(0, address.find_first_of("@>\r\n"));
  std::size_t us = local.find('_');
  if (us == std::string_view::npos) return "inbox";
  std::string_view box = local.substr(us + 1);
  bool plain = !box.empty() && box.size() <= 64 && box.front() != '.' && !str_iequals(box, "overview");
  for (char c : box) {
    bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '.' ||
              c == '_' || c == '-';
    if (!ok) plain = false;
  }
  return plain ? std::string(box) : "inbox";
}

std::string mailbox_path_for_name(std::string_view home, std::string_view name) {
  if (str_iequals(name, "INBOX")) return path_join(home, "mail/inbox");
  return path_join(home, name);
}

std::string mailbox_overview_path(std::string_view mailbox_path) {
  std::size_t slash = mailbox_path.rfind('/');
  if (slash == std::string_view::npos) return "overview/" + std::string(mailbox_path);
  return std::string(mailbox_path.substr(0, slash)) + "/overview" + std::string(mailbox_path.substr(slash));
}

std::uint64_t mailbox_size(const Mailbox& box) {
  std::uint64_t sum = 0;
  for (const auto& m : box.messages) sum += m.total_length;
  return sum;
}

// ---- parsing ----------------------------------------------------------------

std::uint64_t mailbox_parse_message(ByteSource& in, std::uint64_t offset, Mailbox& box) {
  if (offset >= in.size()) return kNoMessage;
  MessageRecord rec;
  std::uint64_t pos = offset;
  Line first = read_line(in, pos);
  if (first.length == 0) return kNoMessage;
  std::uint64_t separator_length = 0;
  rec.internal_date = now();
  if (str_istarts_with(first.text, "From ")) {
    std::time_t t = mailbox_separator_date(first.text);
    if (t != kBadDate) rec.internal_date = t;
    separator_length = first.length;
    pos += first.length;
  }

  // The header: logical lines (continuations joined), examined by name.
  std::string boundary;
  std::string header;
  bool in_header = true;
  bool after_terminator = false;
  std::uint64_t header_end = 0;
  std::uint32_t uid = 0;
  auto examine = [&](std::string_view h) {
    if (h.empty()) return;
    switch (h.front() | 0x20) {
      case 'c':
        if (str_istarts_with(h, "content-type:")) boundary = boundary_of(whole_value(h));
        break;
      case 'd':
        if (str_istarts_with(h, "Date:")) {
          std::time_t t = parse_date(trim_blanks(line_cut(value_after_colon(h))));
          rec.sent_date = t == kBadDate ? 0 : t;
        }
        break;
      case 'f':
        if (str_istarts_with(h, "From:")) rec.from = first_line_value(h);
        break;
      case 'r':
        if (str_istarts_with(h, "Reply-To:")) rec.reply_to = first_line_value(h);
        break;
      case 's':
        if (str_istarts_with(h, "Subject:")) rec.subject = first_line_value(h);
        if (str_istarts_with(h, "Status:") && line_cut(value_after_colon(h)).find('R') != std::string_view::npos) {
          rec.flags |= msgflag::seen;
        }
        break;
      case 't':
        if (str_istarts_with(h, "To:")) rec.to = first_line_value(h);
        break;
      case 'x':
        if (str_istarts_with(h, "X-Status:")) {
          std::string_view v = line_cut(value_after_colon(h));
          if (v.find('D') != std::string_view::npos) rec.flags |= msgflag::deleted;
          if (v.find('A') != std::string_view::npos) rec.flags |= msgflag::answered;
        } else if (str_istarts_with(h, "X-UID:")) {
          uid = parse_u32(value_after_colon(h));
        } else if (h.size() > 2 && (str_istarts_with(h.substr(2), "read-receipt: yes") ||
                                    str_istarts_with(h.substr(2), "return-receipt-to:"))) {
          rec.flags |= msgflag::receipt_wanted;
        }
        break;
      default:
        break;
    }
  };

  std::unique_ptr<MimeScanner> mime;
  std::uint64_t end = in.size();
  while (pos < in.size()) {
    Line line = read_line(in, pos);
    if (line.length == 0) break;
    if (after_terminator && str_istarts_with(line.text, "From ")) {
      end = pos;
      break;
    }
    after_terminator = is_terminator_line(line.text);
    if (in_header) {
      if (is_empty_line(line.text) || after_terminator) {
        examine(header);
        header.clear();
        in_header = false;
        header_end = after_terminator ? pos : pos + line.length;
        if (!boundary.empty()) mime = std::make_unique<MimeScanner>(rec.parts, boundary);
      } else if (is_blank(line.text.front()) && !header.empty()) {
        append_bounded(header, line.text);
      } else {
        examine(header);
        header.clear();
        append_bounded(header, line.text);
      }
    } else if (mime && !after_terminator) {
      mime->line(line.text, pos - offset, line.length);
    }
    pos += line.length;
  }
  if (in.failed()) return kNoMessage;
  if (in_header) {
    examine(header);
    header_end = end;
  }
  if (mime) {
    mime->finish(end - offset);
    if (!rec.parts.empty()) rec.flags |= msgflag::mime;
  }

  rec.total_length = end - offset;
  rec.length = rec.total_length - separator_length;
  rec.header_length = header_end - offset;
  if (box.next_uid == 0) box.next_uid = 1;
  rec.uid = uid ? uid : box.next_uid;
  box.next_uid = std::max(box.next_uid, rec.uid + 1);
  ++box.count;
  if (!(rec.flags & msgflag::seen)) ++box.unseen;
  box.messages.push_back(std::move(rec));
  box.changed = true;
  return end < in.size() ? end : kNoMessage;
}

int mailbox_commit(Mailbox& box, ByteSource& in, std::uint64_t from) {
  std::size_t before = box.messages.size();
  std::uint32_t next = box.next_uid;
  parse_all(box, in, from);
  recount(box);
  int rc = in.failed() ? EIO : mailbox_overview_write(box);
  if (rc) {
    box.messages.resize(before);
    box.next_uid = next;
    recount(box);
  }
  return rc;
}

// ---- overview -----------------------------------------------------------------

std::string mailbox_overview_text(const Mailbox& box) {
  auto clean = [](std::string_view v) {
    std::string s;
    s.reserve(v.size());
    for (char c : v) {
      if (c != '\r' && c != '\n') s += c;
    }
    return s;
  };
  auto date = [](std::time_t t) -> unsigned long long {
    return t == kBadDate ? static_cast<unsigned long long>(now()) : static_cast<unsigned long long>(t);
  };
  std::string out;
  // The next identifier is kept too, so identifiers are never reused after
  // the newest messages were removed.
  strappendf(out, "#uidnext %u\n#length %llu\n", box.next_uid,
             static_cast<unsigned long long>(mailbox_size(box)));
  for (const auto& m : box.messages) {
    strappendf(out, "#msg\n%llu,%llu,%llu,%llu,%u,%u,%llu\n", date(m.internal_date),
               static_cast<unsigned long long>(m.sent_date), static_cast<unsigned long long>(m.total_length),
               static_cast<unsigned long long>(m.length), m.flags, m.uid,
               static_cast<unsigned long long>(m.header_length));
    for (const std::string* v : {&m.from, &m.to, &m.subject, &m.reply_to}) {
      out += clean(*v);
      out += '\n';
    }
    for (const auto& p : m.parts) {
      strappendf(out, "#mime\n%u,%u,%u,%d,%d,%d\n", p.length, p.lines, p.body_offset, p.encoding, p.level,
                 p.number);
      for (const std::string* v : {&p.content_type, &p.description, &p.content_id}) {
        out += clean(*v);
        out += '\n';
      }
    }
    out += "#end\n";
  }
  return out;
}

int mailbox_overview_parse(Mailbox& box, std::string_view text) {
  std::list<MessageRecord> messages;
  std::uint32_t next = 1;
  std::optional<std::uint64_t> committed;
  // Numbers must fit their fields, or what is written back would differ.
  constexpr unsigned long long kU32 = 0xffffffffULL, kInt = 0x7fffffffULL;
  auto next_line = [&](std::string_view& line) {
    if (text.empty()) return false;
    std::size_t lf = text.find('\n');
    if (lf == std::string_view::npos) return false;  // a cut-off last line
    line = text.substr(0, lf);
    text.remove_prefix(lf + 1);
    return true;
  };
  auto numbers = [](std::string_view line, unsigned long long* out, std::size_t count) {
    const char* p = line.data();
    const char* e = line.data() + line.size();
    for (std::size_t i = 0; i < count; ++i) {
      auto r = std::from_chars(p, e, out[i]);
      if (r.ec != std::errc()) return false;
      p = r.ptr;
      if (i + 1 < count) {
        if (p == e || *p != ',') return false;
        ++p;
      }
    }
    return p == e;
  };
  std::string_view line;
  MessageRecord* current = nullptr;
  while (next_line(line)) {
    if (line.substr(0, 9) == "#uidnext ") {
      next = std::max(next, parse_u32(line.substr(9)));
    } else if (line.substr(0, 8) == "#length ") {
      std::uint64_t v = 0;
      if (std::from_chars(line.data() + 8, line.data() + line.size(), v).ec != std::errc()) return 1;
      committed = v;
    } else if (line == "#msg") {
      std::string_view nums, from, to, subject, reply_to;
      unsigned long long v[7];
      if (!next_line(nums) || !numbers(nums, v, 7) || v[4] > kU32 || v[5] > kU32 || !next_line(from) || !next_line(to) ||
          !next_line(subject) || !next_line(reply_to)) {
        return 1;
      }
      MessageRecord& m = messages.emplace_back();
      m.internal_date = static_cast<std::time_t>(v[0]);
      m.sent_date = static_cast<std::time_t>(v[1]);
      m.total_length = v[2];
      m.length = v[3];
      m.flags = static_cast<std::uint32_t>(v[4]);
      m.uid = static_cast<std::uint32_t>(v[5]);
      m.header_length = v[6];
      if (m.length > m.total_length || m.header_length > m.total_length) return 1;
      m.from = from;
      m.to = to;
      m.subject = subject;
      m.reply_to = reply_to;
      next = std::max(next, m.uid + 1);
      current = &m;
    } else if (line == "#mime") {
      std::string_view nums, type, desc, id;
      unsigned long long v[6];
      if (!current || !next_line(nums) || !numbers(nums, v, 6) || std::any_of(v, v + 6, [](auto n) { return n > kU32; }) ||
          v[3] > kInt || v[4] > kInt || v[5] > kInt || !next_line(type) || !next_line(desc) ||
          !next_line(id)) {
        return 1;
      }
      MimePart& p = current->parts.emplace_back();
      p.content_type = type;
      p.description = desc;
      p.content_id = id;
      p.length = static_cast<std::uint32_t>(v[0]);
      p.lines = static_cast<std::uint32_t>(v[1]);
      p.body_offset = static_cast<std::uint32_t>(v[2]);
      p.encoding = static_cast<int>(v[3]);
      p.level = static_cast<int>(v[4]);
      p.number = static_cast<int>(v[5]);
    } else if (line == "#end") {
      if (!current) return 1;
      current = nullptr;
    }
  }
  if (current) return 1;  // the last message's block was cut off
  std::uint64_t sum = 0;
  for (const auto& m : messages) sum += m.total_length;
  if (committed && *committed != sum) return 1;  // whole message blocks are missing
  box.messages = std::move(messages);
  box.next_uid = next;
  box.loaded = now();
  recount(box);
  return 0;
}

int mailbox_overview_write(Mailbox& box) {
  std::string path = mailbox_overview_path(box.path);
  SafeDir dir;
  SafeResult where = open_folder_of(box.home, path, true, dir);
  int rc = where.ok() ? dir.replace_file(path_leaf(path), mailbox_overview_text(box), 0600) : where.error;
  if (rc == 0) {
    box.overview_written = now();
    box.changed = false;
  } else {
    log_message("Mailbox overview write failed:", path + " " + error_text(rc), logfac::maildebatch);
  }
  return rc;
}

int mailbox_overview_read(Mailbox& box) {
  struct timespec written {};
  return read_overview(box, written);
}

// ---- the cache ----------------------------------------------------------------

Mailbox* mailbox_lookup(const std::string& path, const std::string& home) {
  UniqueFd fd;
  if (!open_below(home, path, O_RDONLY, fd).ok()) return nullptr;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return nullptr;
  FileSource in(std::move(fd));
  for (auto& box : g_boxes) {
    if (box.path != path) continue;  // paths are case-sensitive here
    settle(box, in, st);
    recount(box);
    box.looked_up = now();
    return &box;
  }
  Mailbox& box = g_boxes.emplace_front();
  box.path = path;
  box.home = home;
  box.looked_up = now();
  // The overview is trusted when it describes this very file: the same
  // length, written after the mailbox last changed; or a shorter length,
  // which the file is then settled to. Anything else (a hand edit, a crash
  // inside an expunge) is parsed again.
  struct timespec written {};
  if (read_overview(box, written) == 0) {
    std::uint64_t known = mailbox_size(box);
    if (known < in.size() || (known == in.size() && !newer(st.st_mtim, written))) {
      settle(box, in, st);
      return &box;
    }
  }
  rebuild(box, in);  // keeps the next identifier the overview knew
  return &box;
}

Mailbox* mailbox_lookup(const std::string& path) { return mailbox_lookup(path, home_of(path)); }

UniqueFd mailbox_open(const Mailbox& box) {
  UniqueFd fd;
  open_below(box.home, box.path, O_RDONLY, fd);
  return fd;
}

void mailbox_cache_clear() { g_boxes.clear(); }

bool mailbox_take(Mailbox& box, std::uint64_t owner) {
  if (box.flags & boxflag::in_use) return box.in_use_by == owner;
  box.flags |= boxflag::in_use;
  box.in_use_by = owner;
  return true;
}

void mailbox_release(Mailbox& box, std::uint64_t owner) {
  if ((box.flags & boxflag::in_use) && box.in_use_by == owner) {
    box.flags &= ~boxflag::in_use;
    box.in_use_by = 0;
  }
}

// ---- expunge ----------------------------------------------------------------

int mailbox_expunge(Mailbox& box) {
  bool any = std::any_of(box.messages.begin(), box.messages.end(),
                         [](const MessageRecord& m) { return m.flags & msgflag::deleted; });
  if (!any) return 0;
  // Everything happens inside the mailbox's folder, reached the safe way;
  // nothing is looked up by path again.
  SafeDir dir;
  if (SafeResult r = open_folder_of(box.home, box.path, false, dir); !r.ok()) return r.error;
  std::string leaf(path_leaf(box.path));
  UniqueFd old;
  if (SafeResult r = dir.open_file(leaf, O_RDONLY, old); !r.ok()) {
    log_refusal(box.home, r);
    return r.error;
  }
  struct stat st {};
  if (::fstat(old.get(), &st) != 0) return errno;
  if (static_cast<std::uint64_t>(st.st_size) < mailbox_size(box)) return EIO;  // records do not fit the file

  // The new mailbox is written beside the old one, synced, and renamed over
  // it: a crash at any point leaves the old mailbox or the new one, whole.
  std::string tmp = leaf.substr(0, 10) + "~";
  UniqueFd out;
  if (SafeResult r = dir.create_new(tmp, st.st_mode & 0777, out); !r.ok()) return r.error;
  if (::fchown(out.get(), st.st_uid, st.st_gid) != 0) {
    // Only root may give the file away; the mailbox then keeps our owner.
  }
  int rc = 0;
  std::uint64_t offset = 0, run_start = 0, run_length = 0;
  for (const auto& m : box.messages) {
    if (m.flags & msgflag::deleted) {
      if (run_length && !rc) rc = copy_range(old.get(), run_start, run_length, out.get());
      run_start = offset + m.total_length;
      run_length = 0;
    } else {
      run_length += m.total_length;
    }
    offset += m.total_length;
  }
  if (run_length && !rc) rc = copy_range(old.get(), run_start, run_length, out.get());
  // Whole messages appended behind the records (none while the mark is
  // held) stay; the rest of an interrupted append does not.
  std::uint64_t tail = static_cast<std::uint64_t>(st.st_size) - offset;
  FileSource old_text(old.get());
  if (tail && !whole_messages(old_text, offset)) tail = 0;
  if (tail && !rc) rc = copy_range(old.get(), offset, tail, out.get());
  if (!rc && sysio::fsync(out.get()) != 0) rc = errno;
  if (int c = out.close(); !rc) rc = c;
  if (!rc) rc = dir.rename(tmp, leaf);
  if (rc) {
    dir.remove(tmp);
    log_message("Mailbox expunge failed:", box.path + " " + error_text(rc), logfac::maildebatch);
    return rc;
  }
  dir.sync();
  box.messages.remove_if([](const MessageRecord& m) { return m.flags & msgflag::deleted; });
  recount(box);
  if (tail) {
    UniqueFd now_fd;
    if (dir.open_file(leaf, O_RDONLY, now_fd).ok()) {
      FileSource in(std::move(now_fd));
      parse_all(box, in, mailbox_size(box));
      recount(box);
    }
  }
  box.changed = true;
  mailbox_overview_write(box);
  return 0;
}

}  // namespace velmor
