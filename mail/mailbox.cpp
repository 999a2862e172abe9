// Mailbox files, their overview index and the in-memory mailbox cache.
#include "mail/mailbox.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <unordered_map>
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

// A validity for identifiers starting afresh: the time, and never the one a
// mailbox of that path had before in this run.
std::uint32_t fresh_validity(const std::string& path) {
  static std::unordered_map<std::string, std::uint32_t> given;
  auto v = static_cast<std::uint32_t>(std::time(nullptr));
  std::uint32_t& last = given[path];
  if (v <= last) v = last + 1;
  if (v == 0) v = 1;
  last = v;
  return v;
}

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


// ---- the record's counts ------------------------------------------------------

void count_in(Mailbox& box, const MessageRecord& m) {
  ++box.count;
  if (!(m.flags & msgflag::seen)) ++box.unseen;
  box.bytes += m.total_length;
}

void count_out(Mailbox& box, const MessageRecord& m) {
  --box.count;
  if (!(m.flags & msgflag::seen)) --box.unseen;
  box.bytes -= m.total_length;
}

void recount(Mailbox& box) {
  box.count = box.unseen = 0;
  box.bytes = 0;
  for (const auto& m : box.messages) count_in(box, m);
}

// Identifiers rise through the mailbox: a message's own X-UID counts only
// when it is above the one before (and leaves room above it); any other
// gets the next identifier.
void add_parsed(Mailbox& box, MessageRecord rec) {
  constexpr std::uint32_t kHighestOwn = 0x7fffffff;
  std::uint32_t last = box.messages.empty() ? 0 : box.messages.back().uid;
  if (box.next_uid <= last) box.next_uid = last + 1;
  if (box.next_uid == 0) box.next_uid = 1;
  if (rec.uid <= last || rec.uid > kHighestOwn) rec.uid = box.next_uid;
  box.next_uid = std::max(box.next_uid, rec.uid + 1);
  count_in(box, rec);
  box.messages.push_back(std::move(rec));
  box.changed = true;
}

std::uint64_t parse_all(Mailbox& box, ByteSource& in, std::uint64_t from) {
  std::uint64_t off = from;
  while (off != kNoMessage && off < in.size()) off = mailbox_parse_message(in, off, box);
  return off;
}

void reset(Mailbox& box) {
  box.messages.clear();
  box.flags_pending.clear();
  recount(box);
  box.loaded = now();
}

// ---- overview text --------------------------------------------------------------

std::string clean(std::string_view v) {
  std::string s;
  s.reserve(v.size());
  for (char c : v) {
    if (c != '\r' && c != '\n') s += c;
  }
  return s;
}

void append_entry(std::string& out, const MessageRecord& m) {
  auto date = [](std::time_t t) -> unsigned long long {
    return t == kBadDate ? static_cast<unsigned long long>(now()) : static_cast<unsigned long long>(t);
  };
  strappendf(out, "#msg\n%llu,%llu,%llu,%llu,%u,%u,%llu\n", date(m.internal_date),
             static_cast<unsigned long long>(m.sent_date), static_cast<unsigned long long>(m.total_length),
             static_cast<unsigned long long>(m.length), m.flags, m.uid,
             static_cast<unsigned long long>(m.header_length));
  for (const std::string* v : {&m.from, &m.to, &m.subject, &m.reply_to}) {
    out += clean(*v);
    out += '\n';
  }
  if (m.dots != kUncounted) {
    strappendf(out, "#text %llu,%u,%llu\n", static_cast<unsigned long long>(m.dots), m.end_line,
               static_cast<unsigned long long>(m.body_lines));
  }
  for (const auto& p : m.parts) {
    strappendf(out, "#mime\n%u,%u,%u,%d,%d,%d\n", p.length, p.lines, p.body_offset, p.encoding, p.level, p.number);
    for (const std::string* v : {&p.content_type, &p.description, &p.content_id}) {
      out += clean(*v);
      out += '\n';
    }
  }
  out += "#end\n";
}

std::uint64_t entry_size(const MessageRecord& m) {
  std::string text;
  append_entry(text, m);
  return text.size();
}

// Ends every write to the overview: the next identifier and the committed
// length. A reader takes the last such line, so the file is whole exactly
// where one of them ends.
void append_trailer(std::string& out, const Mailbox& box) {
  if (box.uid_validity) strappendf(out, "#uidvalidity %u\n", box.uid_validity);
  strappendf(out, "#uidnext %u\n#length %llu\n", box.next_uid, static_cast<unsigned long long>(box.bytes));
}

void append_pending_flags(std::string& out, const Mailbox& box) {
  for (const MessageRecord* m : box.flags_pending) strappendf(out, "#flags %u %u\n", m->uid, m->flags);
}

void clear_pending_flags(Mailbox& box) {
  for (MessageRecord* m : box.flags_pending) m->flags_pending = false;
  box.flags_pending.clear();
}

// The overview's parse, also telling how long the text of the live message
// blocks is (for the compaction's reckoning).
int parse_overview(Mailbox& box, std::string_view text, std::uint64_t* live);

// ---- compaction -------------------------------------------------------------------

constexpr std::uint64_t kCompactSlice = 256 * 1024;       // text written per piece
constexpr std::uint64_t kStaleMinimum = 64 * 1024;        // dead text below this is left alone
constexpr std::uint64_t kSmallOverview = 16 * 1024;       // rewritten whole rather than added to after a removal
constexpr std::time_t kCompactRetrySeconds = 60;          // after a failed compaction

struct Compaction {
  SafeDir dir;
  std::string leaf, tmp;
  UniqueFd out;
  std::list<MessageRecord>::iterator last;  // the last record written
  bool any = false;                          // whether `last` is set
  std::uint64_t written = 0, live = 0;
  std::vector<MessageRecord*> changed;       // flags changed since the compaction began
};
std::unordered_map<const Mailbox*, Compaction> g_compactions;
std::unordered_map<const Mailbox*, std::time_t> g_compact_failed;  // when a compaction last failed

void compaction_abort(const Mailbox& box) {
  auto it = g_compactions.find(&box);
  if (it == g_compactions.end()) return;
  it->second.out.close();
  it->second.dir.remove(it->second.tmp);
  g_compactions.erase(it);
}

// ---- files below the home, continued ---------------------------------------

// Writes the whole overview afresh (temporary file, sync, rename, folder
// sync). 0 or an errno value.
int overview_write_whole(Mailbox& box) {
  compaction_abort(box);
  std::string path = mailbox_overview_path(box.path);
  SafeDir dir;
  SafeResult where = open_folder_of(box.home, path, true, dir);
  std::string text;
  std::uint64_t live = 0;
  for (const auto& m : box.messages) {
    std::size_t before = text.size();
    append_entry(text, m);
    live += text.size() - before;
  }
  append_trailer(text, box);
  int rc = where.ok() ? dir.replace_file(path_leaf(path), text, 0600) : where.error;
  if (rc == 0) {
    box.overview_written = now();
    box.overview_size = text.size();
    box.overview_live = live;
    box.changed = false;
    clear_pending_flags(box);
  } else {
    box.overview_size = 0;  // unknown: written whole next time
    log_message("Mailbox overview write failed:", path + " " + error_text(rc), logfac::maildebatch);
  }
  return rc;
}

// Appends records to the overview (they end with the trailer) and syncs
// it. When the file is not as the record last left it, it is written whole
// instead. On failure the file is cut back to where it was. 0 or an errno value.
int overview_append(Mailbox& box, std::string_view records) {
  if (box.overview_size == 0) return overview_write_whole(box);
  std::string path = mailbox_overview_path(box.path);
  UniqueFd fd;
  SafeResult r = open_below(box.home, path, O_WRONLY, fd);
  struct stat st {};
  if (!r.ok() || ::fstat(fd.get(), &st) != 0 || static_cast<std::uint64_t>(st.st_size) != box.overview_size) {
    if (r.refused()) return r.error;
    return overview_write_whole(box);
  }
  int rc = pwrite_all(fd.get(), records, box.overview_size);
  if (!rc && sysio::fsync(fd.get()) != 0) rc = errno;
  if (rc) {
    if (sysio::ftruncate(fd.get(), static_cast<off_t>(box.overview_size)) != 0 || sysio::fsync(fd.get()) != 0)
      box.overview_size = 0;  // what is there now is unknown: written whole next time
    log_message("Mailbox overview append failed:", path + " " + error_text(rc), logfac::maildebatch);
    return rc;
  }
  box.overview_size += records.size();
  box.overview_written = now();
  box.changed = false;
  clear_pending_flags(box);
  return 0;
}

// Records the messages from `first` to the end of the list, which were just
// taken in, in the overview.
int overview_add(Mailbox& box, std::list<MessageRecord>::iterator first) {
  std::string text;
  std::uint64_t live = 0;
  for (auto it = first; it != box.messages.end(); ++it) {
    std::size_t before = text.size();
    append_entry(text, *it);
    live += text.size() - before;
  }
  append_pending_flags(text, box);
  append_trailer(text, box);
  bool whole = box.overview_size == 0;
  int rc = overview_append(box, text);
  if (rc == 0 && !whole) box.overview_live += live;
  return rc;
}

// Every append in flight is given up: the file was replaced or cut back
// under it. Staged messages are told, and the writer starts again.
void appends_lost(Mailbox& box, int error) {
  ++box.epoch;
  box.appending = false;
  box.append_fd.close();
  std::list<StagedMessage> staged;
  staged.swap(box.staged);
  box.tail = box.bytes;
  for (auto& s : staged) {
    if (s.done) s.done(error);
  }
}

// Parses the whole mailbox file again and writes a fresh overview. The next
// identifier never goes down, so a client that remembers identifiers never
// sees one reused.
void rebuild(Mailbox& box, ByteSource& in) {
  std::uint32_t next = std::max<std::uint32_t>(box.next_uid, 1);
  appends_lost(box, EAGAIN);
  // Flags set by readers live in the overview only; the messages that keep
  // their identifiers keep them.
  constexpr std::uint32_t kKept = msgflag::seen | msgflag::answered | msgflag::flagged | msgflag::deleted |
                                  msgflag::draft;
  std::unordered_map<std::uint32_t, std::uint32_t> flags;
  for (const auto& m : box.messages) flags.emplace(m.uid, m.flags & kKept);
  reset(box);
  box.next_uid = 1;
  parse_all(box, in, 0);
  box.next_uid = std::max(box.next_uid, next);
  if (!flags.empty()) {
    for (auto& m : box.messages) {
      auto it = flags.find(m.uid);
      if (it != flags.end()) m.flags = (m.flags & ~kKept) | it->second;
    }
    recount(box);
  }
  mailbox_notify(box);
  box.tail = box.bytes;
  overview_write_whole(box);
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

// Brings a record in line with its file. The file is expected to end where
// our own appends end. A file longer than the records holds either whole
// messages added behind our back, which are parsed, or what an interrupted
// append left, which is cut off so that no later message is glued to it. A
// file that shrank is read again unless a session is using it (its message
// numbers must not move under it).
void settle(Mailbox& box, FileSource& in, const struct stat& st) {
  // (a message being written lies behind `tail`)
  if (in.size() == box.tail || (box.appending && in.size() > box.tail)) return;
  if (box.tail != box.bytes || box.appending) appends_lost(box, EAGAIN);  // changed under our appends
  std::uint64_t known = box.bytes;
  if (in.size() == known) return;
  if (in.size() < known) {
    if (!(box.flags & boxflag::in_use)) rebuild(box, in);
  } else if (whole_messages(in, known)) {
    auto last = box.messages.empty() ? box.messages.end() : std::prev(box.messages.end());
    parse_all(box, in, known);
    box.tail = box.bytes;
    overview_add(box, last == box.messages.end() ? box.messages.begin() : std::next(last));
    mailbox_notify(box);
  } else {
    cut_back(box, st, known);
    ++box.epoch;
  }
}

// Reads the overview file; 0 and its time of writing, or non-zero. Records
// after the last whole "#length" line (an append cut off by a crash) are
// dropped, from the file too.
int read_overview(Mailbox& box, struct timespec& written) {
  std::string path = mailbox_overview_path(box.path);
  UniqueFd fd;
  if (!open_below(box.home, path, O_RDONLY, fd).ok()) return 1;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return 1;
  written = st.st_mtim;
  FileSource in(std::move(fd));
  std::string_view text = in.view(0, static_cast<std::size_t>(in.size()));
  if (text.size() != in.size()) return 1;
  std::uint64_t live = 0;
  std::size_t valid = text.size();
  int rc = parse_overview(box, text, &live);
  for (int tries = 0; rc != 0 && tries < 3; ++tries) {
    // The end of the last whole "#length" line before `valid`.
    std::size_t end = std::string_view::npos;
    for (std::size_t from = valid; from > 0;) {
      std::size_t at = text.rfind("#length ", from - 1);
      if (at == std::string_view::npos) break;
      std::size_t lf = text.find('\n', at);
      if ((at == 0 || text[at - 1] == '\n') && lf != std::string_view::npos && lf + 1 < valid) {
        end = lf + 1;
        break;
      }
      from = at;
    }
    if (end == std::string_view::npos) break;
    valid = end;
    rc = parse_overview(box, text.substr(0, valid), &live);
  }
  if (rc != 0) return rc;
  box.overview_size = valid;
  box.overview_live = live;
  if (valid < text.size()) {
    UniqueFd w;
    if (!open_below(box.home, path, O_WRONLY, w).ok() || sysio::ftruncate(w.get(), static_cast<off_t>(valid)) != 0 ||
        sysio::fsync(w.get()) != 0)
      box.overview_size = 0;
    log_write(strprintf("Mailbox overview %s: an unfinished append of %zu bytes dropped", path.c_str(),
                        text.size() - valid),
              logchan::errors);
  }
  return 0;
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

std::uint64_t mailbox_size(const Mailbox& box) { return box.bytes; }

// ---- parsing ----------------------------------------------------------------

struct MessageParser::State {
  std::uint64_t offset = 0, pos = 0, end = 0, size = 0;
  bool started = false, done = false, empty = false, failed = false;
  MessageRecord rec;
  std::uint64_t separator_length = 0;
  // The header: logical lines (continuations joined), examined by name.
  std::string boundary, header;
  bool in_header = true, after_terminator = false;
  std::uint64_t header_end = 0;
  // The counts of the text a reader is given (MessageRecord::dots ...).
  std::uint64_t dots = 0, body_lines = 0, last_length = 0;
  bool last_in_body = false;
  std::unique_ptr<MimeScanner> mime;

  void examine(std::string_view h) {
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
          rec.uid = parse_u32(value_after_colon(h));
        } else if (h.size() > 2 && (str_istarts_with(h.substr(2), "read-receipt: yes") ||
                                    str_istarts_with(h.substr(2), "return-receipt-to:"))) {
          rec.flags |= msgflag::receipt_wanted;
        }
        break;
      default:
        break;
    }
  }

  void start(ByteSource& in) {
    started = true;
    pos = offset;
    if (offset >= in.size()) {
      done = empty = true;
      return;
    }
    Line first = read_line(in, pos);
    if (first.length == 0) {
      done = empty = true;
      return;
    }
    rec.internal_date = now();
    if (str_istarts_with(first.text, "From ")) {
      std::time_t t = mailbox_separator_date(first.text);
      if (t != kBadDate) rec.internal_date = t;
      separator_length = first.length;
      pos += first.length;
    }
  }

  // Lines until `stop`; true when the message has ended.
  bool lines(ByteSource& in, std::uint64_t stop) {
    while (pos < in.size()) {
      if (pos >= stop) return false;
      Line line = read_line(in, pos);
      if (line.length == 0) break;
      if (after_terminator && str_istarts_with(line.text, "From ")) {
        end = pos;
        return true;
      }
      after_terminator = is_terminator_line(line.text);
      if (line.text.front() == '.') ++dots;
      last_in_body = !in_header || after_terminator;  // a "." line ending the header is the body's
      if (last_in_body) ++body_lines;
      last_length = line.length;
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
    end = in.size();
    return true;
  }

  void finish(ByteSource& in) {
    done = true;
    size = in.size();
    if (in.failed()) {
      failed = true;
      return;
    }
    if (in_header) {
      examine(header);
      header_end = end;
    }
    if (mime) {
      mime->finish(end - offset);
      mime.reset();
      if (!rec.parts.empty()) rec.flags |= msgflag::mime;
    }
    rec.total_length = end - offset;
    rec.length = rec.total_length - separator_length;
    rec.header_length = header_end - offset;
    if (after_terminator) {  // the closing "." line is not part of the text
      --dots;
      if (last_in_body) --body_lines;
      rec.end_line = static_cast<std::uint32_t>(last_length);
    }
    rec.dots = dots;
    rec.body_lines = body_lines;
  }
};

MessageParser::MessageParser(std::uint64_t offset) : s_(std::make_unique<State>()) { s_->offset = offset; }
MessageParser::MessageParser(MessageParser&&) noexcept = default;
MessageParser& MessageParser::operator=(MessageParser&&) noexcept = default;
MessageParser::~MessageParser() = default;

bool MessageParser::step(ByteSource& in, std::uint64_t budget) {
  State& s = *s_;
  if (s.done) return true;
  if (!s.started) {
    s.start(in);
    if (s.done) return true;
  }
  std::uint64_t stop = budget > kNoMessage - s.pos ? kNoMessage : s.pos + budget;
  if (!s.lines(in, stop)) return false;
  s.finish(in);
  return true;
}

MessageRecord MessageParser::take(std::uint64_t& next) {
  State& s = *s_;
  if (!s.done || s.empty || s.failed) {
    next = kNoMessage;
    return {};
  }
  next = s.end < s.size ? s.end : kNoMessage;
  return std::move(s.rec);
}

std::uint64_t mailbox_parse_message(ByteSource& in, std::uint64_t offset, Mailbox& box) {
  MessageParser parser(offset);
  parser.step(in, kNoMessage);
  std::uint64_t next = kNoMessage;
  MessageRecord rec = parser.take(next);
  if (rec.total_length == 0) return kNoMessage;  // nothing there, or the file could not be read
  add_parsed(box, std::move(rec));
  return next;
}

// ---- overview -----------------------------------------------------------------

std::string mailbox_overview_text(const Mailbox& box) {
  std::string out;
  for (const auto& m : box.messages) append_entry(out, m);
  append_trailer(out, box);
  return out;
}

namespace {

int parse_overview(Mailbox& box, std::string_view text, std::uint64_t* live_out) {
  std::list<MessageRecord> messages;
  // The message blocks by identifier (they rise), with the length of their
  // text, so that later records can name them.
  struct Block {
    std::uint32_t uid;
    std::list<MessageRecord>::iterator at;
    std::uint64_t size;
    bool gone;
  };
  std::vector<Block> blocks;
  std::uint32_t next = 1, validity = 0;
  std::optional<std::uint64_t> committed;
  std::uint64_t sum = 0;
  // Numbers must fit their fields, or what is written back would differ.
  constexpr unsigned long long kU32 = 0xffffffffULL, kInt = 0x7fffffffULL;
  // A text that does not end with a whole line was cut off.
  if (!text.empty() && text.back() != '\n') return 1;
  auto next_line = [&](std::string_view& line) {
    if (text.empty()) return false;
    std::size_t lf = text.find('\n');
    if (lf == std::string_view::npos) return false;
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
  // The live block of a message named by a later record.
  auto block_of = [&](std::string_view number) -> Block* {
    unsigned long long uid = 0;
    auto r = std::from_chars(number.data(), number.data() + number.size(), uid);
    if (r.ec != std::errc() || uid > kU32) return nullptr;
    auto it = std::lower_bound(blocks.begin(), blocks.end(), static_cast<std::uint32_t>(uid),
                               [](const Block& b, std::uint32_t u) { return b.uid < u; });
    if (it == blocks.end() || it->uid != uid || it->gone) return nullptr;
    return &*it;
  };
  std::string_view line;
  MessageRecord* current = nullptr;
  const char* block_start = nullptr;
  while (next_line(line)) {
    if (line.substr(0, 9) == "#uidnext ") {
      next = std::max(next, parse_u32(line.substr(9)));
    } else if (line.substr(0, 13) == "#uidvalidity ") {
      validity = parse_u32(line.substr(13));
    } else if (line.substr(0, 8) == "#length ") {
      std::uint64_t v = 0;
      if (std::from_chars(line.data() + 8, line.data() + line.size(), v).ec != std::errc()) return 1;
      committed = v;
    } else if (line == "#msg") {
      if (current) return 1;
      block_start = line.data();
      std::string_view nums, from, to, subject, reply_to;
      unsigned long long v[7];
      if (!next_line(nums) || !numbers(nums, v, 7) || v[4] > kU32 || v[5] > kU32 || !next_line(from) || !next_line(to) ||
          !next_line(subject) || !next_line(reply_to)) {
        return 1;
      }
      if (!blocks.empty() && v[5] <= blocks.back().uid) return 1;  // identifiers rise
      if (v[5] == 0) return 1;
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
      sum += m.total_length;
      blocks.push_back({m.uid, std::prev(messages.end()), 0, false});
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
    } else if (line.substr(0, 6) == "#text ") {
      // dots, the closing line's length, body lines; they must fit the message
      unsigned long long v[3];
      if (!current || !numbers(line.substr(6), v, 3) || (v[1] != 0 && v[1] != 2 && v[1] != 3) ||
          v[1] > current->length || v[0] > current->length - v[1] || v[2] > current->length) {
        return 1;
      }
      current->dots = v[0];
      current->end_line = static_cast<std::uint32_t>(v[1]);
      current->body_lines = v[2];
    } else if (line == "#end") {
      if (!current) return 1;
      current = nullptr;
      blocks.back().size = static_cast<std::uint64_t>(text.data() - block_start);
    } else if (line.substr(0, 7) == "#flags ") {
      std::string_view rest = line.substr(7);
      std::size_t blank = rest.find(' ');
      Block* b = current || blank == std::string_view::npos ? nullptr : block_of(rest.substr(0, blank));
      unsigned long long flags = 0;
      std::string_view f = rest.substr(blank == std::string_view::npos ? rest.size() : blank + 1);
      auto r = std::from_chars(f.data(), f.data() + f.size(), flags);
      if (!b || r.ec != std::errc() || r.ptr != f.data() + f.size() || flags > kU32) return 1;
      b->at->flags = static_cast<std::uint32_t>(flags);
    } else if (line.substr(0, 9) == "#expunge ") {
      Block* b = current ? nullptr : block_of(line.substr(9));
      if (!b) return 1;
      sum -= b->at->total_length;
      messages.erase(b->at);
      b->gone = true;
    }
  }
  if (current) return 1;  // the last message's block was cut off
  if (!committed || *committed != sum) return 1;  // cut off, or whole message blocks are missing
  std::uint64_t live = 0;
  for (const Block& b : blocks) {
    if (!b.gone) live += b.size;
  }
  if (live_out) *live_out = live;
  box.messages = std::move(messages);
  box.flags_pending.clear();
  box.next_uid = next;
  if (validity) box.uid_validity = validity;
  box.loaded = now();
  recount(box);
  box.tail = box.bytes;
  return 0;
}

}  // namespace

int mailbox_overview_parse(Mailbox& box, std::string_view text) { return parse_overview(box, text, nullptr); }

int mailbox_overview_write(Mailbox& box) { return overview_write_whole(box); }

int mailbox_overview_read(Mailbox& box) {
  struct timespec written {};
  return read_overview(box, written);
}

// ---- appends --------------------------------------------------------------------

int mailbox_append_begin(Mailbox& box, UniqueFd fd, AppendSlot& slot) {
  if (box.appending) return EAGAIN;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return errno;
  if (box.append_fd) {
    struct stat held {};
    if (::fstat(box.append_fd.get(), &held) != 0 || held.st_ino != st.st_ino || held.st_dev != st.st_dev)
      appends_lost(box, EAGAIN);  // the file was replaced under the staged messages
  }
  // The message goes behind the last one written. A file that does not
  // match (it could not be cut back, or changed while a session holds it)
  // waits, rather than glue the message to something unknown.
  if (static_cast<std::uint64_t>(st.st_size) != box.tail) return ESTALE;
  if (!box.append_fd) box.append_fd = std::move(fd);
  if (box.next_uid == 0) box.next_uid = 1;
  slot.offset = box.tail;
  slot.uid = box.next_uid++;
  slot.epoch = box.epoch;
  box.appending = true;
  return 0;
}

int mailbox_append_fd(const Mailbox& box) { return box.append_fd.get(); }

bool mailbox_append_stale(const Mailbox& box, const AppendSlot& slot) { return box.epoch != slot.epoch; }

void mailbox_append_stage(Mailbox& box, const AppendSlot& slot, MessageRecord record, std::function<void(int)> done) {
  record.uid = slot.uid;
  box.tail = slot.offset + record.total_length;
  box.appending = false;
  box.staged.push_back({std::move(record), std::move(done)});
}

void mailbox_append_abandon(Mailbox& box, const AppendSlot& slot) {
  if (mailbox_append_stale(box, slot)) return;  // the file was settled without it
  box.appending = false;
  if (box.append_fd) {
    int fd = box.append_fd.get();
    if (sysio::ftruncate(fd, static_cast<off_t>(slot.offset)) == 0) sysio::fsync(fd);
  }
  box.tail = slot.offset;
  if (box.next_uid == slot.uid + 1) box.next_uid = slot.uid;
  if (box.staged.empty()) box.append_fd.close();
}

int mailbox_commit_staged(Mailbox& box) {
  if (box.staged.empty()) return 0;
  std::list<StagedMessage> staged;
  staged.swap(box.staged);
  std::uint32_t first_uid = staged.front().record.uid;
  std::uint64_t before = box.bytes;
  int rc = sysio::fsync(box.append_fd.get()) == 0 ? 0 : errno;
  auto last = box.messages.empty() ? box.messages.end() : std::prev(box.messages.end());
  if (!rc) {
    for (auto& s : staged) {
      count_in(box, s.record);
      box.messages.push_back(std::move(s.record));
    }
    rc = overview_add(box, last == box.messages.end() ? box.messages.begin() : std::next(last));
    if (rc) {
      auto first = last == box.messages.end() ? box.messages.begin() : std::next(last);
      for (auto it = first; it != box.messages.end(); ++it) count_out(box, *it);
      box.messages.erase(first, box.messages.end());
    }
  }
  if (rc) {
    // Nothing of the group counts: the mailbox is cut back to what was
    // committed, and the identifiers are handed out again.
    int fd = box.append_fd.get();
    if (sysio::ftruncate(fd, static_cast<off_t>(before)) == 0) sysio::fsync(fd);
    bool in_flight = box.appending;
    box.tail = before;
    if (in_flight) {
      ++box.epoch;  // the message being written was cut off too: it starts again
      box.appending = false;
    }
    box.next_uid = first_uid;
    box.append_fd.close();
    log_write("Mailbox " + box.path + ": " + std::to_string(staged.size()) + " messages not delivered: " +
                  error_text(rc),
              logchan::errors);
  } else {
    box.flags |= boxflag::new_mail | boxflag::delivered;
    if (!box.appending) box.append_fd.close();
  }
  for (auto& s : staged) {
    if (s.done) s.done(rc);
  }
  if (!rc) mailbox_notify(box);
  return rc;
}

void mailbox_append_withdraw(Mailbox& box, int error) {
  if (box.staged.empty() || box.appending) return;
  std::list<StagedMessage> staged;
  staged.swap(box.staged);
  if (box.append_fd) {
    int fd = box.append_fd.get();
    if (sysio::ftruncate(fd, static_cast<off_t>(box.bytes)) == 0) sysio::fsync(fd);
  }
  box.tail = box.bytes;
  box.next_uid = staged.front().record.uid;
  box.append_fd.close();
  for (auto& s : staged) {
    if (s.done) s.done(error);
  }
}

void mailbox_commit_staged() {
  for (auto& box : g_boxes) {
    if (!box.staged.empty()) mailbox_commit_staged(box);
  }
}

// ---- flags and compaction -------------------------------------------------------

void mailbox_flags_changed(Mailbox& box, MessageRecord& message) {
  box.changed = true;
  mailbox_notify(box);
  if (!message.flags_pending) {
    message.flags_pending = true;
    box.flags_pending.push_back(&message);
  }
  auto it = g_compactions.find(&box);
  if (it != g_compactions.end()) it->second.changed.push_back(&message);
}

int mailbox_overview_flush(Mailbox& box) {
  if (box.flags_pending.empty()) return 0;
  std::string text;
  append_pending_flags(text, box);
  append_trailer(text, box);
  return overview_append(box, text);
}

bool mailbox_overview_stale(const Mailbox& box) {
  if (box.overview_size <= box.overview_live) return false;
  std::uint64_t dead = box.overview_size - box.overview_live;
  return dead > kStaleMinimum && dead > box.overview_live / 2;
}

CompactStep mailbox_compact_step(Mailbox& box, std::chrono::steady_clock::time_point deadline) {
  auto found = g_compactions.find(&box);
  if (found == g_compactions.end()) {
    Compaction c;
    std::string path = mailbox_overview_path(box.path);
    c.leaf = std::string(path_leaf(path));
    c.tmp = c.leaf + "~";
    SafeResult r = open_folder_of(box.home, path, true, c.dir);
    if (r.ok()) r = c.dir.create_new(c.tmp, 0600, c.out);
    if (!r.ok()) {
      g_compact_failed[&box] = now();
      return CompactStep::failed;
    }
    found = g_compactions.emplace(&box, std::move(c)).first;
  }
  Compaction& c = found->second;
  auto fail = [&](int rc) {
    log_message("Mailbox overview compaction failed:", box.path + " " + error_text(rc), logfac::maildebatch);
    compaction_abort(box);
    g_compact_failed[&box] = now();
    return CompactStep::failed;
  };
  std::string text;
  for (;;) {
    auto it = c.any ? std::next(c.last) : box.messages.begin();
    for (int n = 0; it != box.messages.end() && text.size() < kCompactSlice; ++it, ++n) {
      std::size_t before = text.size();
      append_entry(text, *it);
      c.live += text.size() - before;
      c.last = it;
      c.any = true;
      if (n % 64 == 63 && std::chrono::steady_clock::now() >= deadline) break;
    }
    if (int rc = write_all(c.out.get(), text)) return fail(rc);
    c.written += text.size();
    text.clear();
    if (c.any ? std::next(c.last) == box.messages.end() : box.messages.empty()) break;
    if (std::chrono::steady_clock::now() >= deadline) return CompactStep::working;
  }
  // Every record is written: flags changed meanwhile, the trailer, and the
  // file is synced and takes the overview's name.
  for (const MessageRecord* m : c.changed) strappendf(text, "#flags %u %u\n", m->uid, m->flags);
  append_trailer(text, box);
  if (int rc = write_all(c.out.get(), text)) return fail(rc);
  c.written += text.size();
  if (sysio::fsync(c.out.get()) != 0) return fail(errno);
  if (int rc = c.out.close()) return fail(rc);
  if (int rc = c.dir.rename(c.tmp, c.leaf)) return fail(rc);
  c.dir.sync();
  box.overview_size = c.written;
  box.overview_live = c.live;
  box.overview_written = now();
  box.changed = false;
  clear_pending_flags(box);
  g_compactions.erase(found);
  g_compact_failed.erase(&box);
  return CompactStep::done;
}

bool mailbox_upkeep_running() { return !g_compactions.empty(); }

bool mailbox_upkeep(std::chrono::steady_clock::time_point deadline) {
  bool more = false;
  for (auto& box : g_boxes) {
    if (std::chrono::steady_clock::now() >= deadline) return true;
    bool running = g_compactions.count(&box) > 0;
    if (!running && !box.flags_pending.empty()) mailbox_overview_flush(box);
    if (!running) {
      auto failed = g_compact_failed.find(&box);
      bool waiting = failed != g_compact_failed.end() && now() < failed->second + kCompactRetrySeconds;
      if (waiting || !mailbox_overview_stale(box)) continue;
    }
    if (mailbox_compact_step(box, deadline) == CompactStep::working) more = true;
  }
  return more;
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
  // inside an expunge) is parsed again. Reading it is the one cost of
  // opening a mailbox; the file itself is not read.
  struct timespec written {};
  if (read_overview(box, written) == 0) {
    std::uint64_t known = mailbox_size(box);
    if (known < in.size() || (known == in.size() && !newer(st.st_mtim, written))) {
      settle(box, in, st);
      if (!box.uid_validity) {
        // An overview from before identifiers were given a validity: one
        // is chosen now, and kept.
        box.uid_validity = fresh_validity(box.path);
        std::string trailer;
        append_trailer(trailer, box);
        overview_append(box, trailer);
      }
      box.recent_uid = box.next_uid - 1;
      return &box;
    }
  }
  // A new mailbox, or one whose overview was lost: its identifiers start a
  // new validity (a rebuild of a known overview keeps it).
  if (!box.uid_validity) box.uid_validity = fresh_validity(box.path);
  rebuild(box, in);  // keeps the next identifier the overview knew
  box.recent_uid = box.next_uid - 1;
  return &box;
}

Mailbox* mailbox_lookup(const std::string& path) { return mailbox_lookup(path, home_of(path)); }

UniqueFd mailbox_open(const Mailbox& box) {
  UniqueFd fd;
  open_below(box.home, box.path, O_RDONLY, fd);
  return fd;
}

void mailbox_cache_clear() {
  for (auto& box : g_boxes) compaction_abort(box);
  g_compact_failed.clear();
  g_boxes.clear();
}

bool mailbox_take(Mailbox& box, std::uint64_t owner) {
  if (box.flags & boxflag::in_use) return box.in_use_by == owner;
  box.flags |= boxflag::in_use;
  box.in_use_by = owner;
  return true;
}

bool mailbox_share(Mailbox& box, std::uint64_t owner, std::function<void()> changed) {
  if ((box.flags & boxflag::in_use) && box.sharers.empty()) return false;  // held whole by another
  for (auto& s : box.sharers) {
    if (s.owner == owner) {
      s.changed = std::move(changed);
      return true;
    }
  }
  box.flags |= boxflag::in_use;
  box.in_use_by = 0;
  box.sharers.push_back({owner, std::move(changed)});
  return true;
}

bool mailbox_share_pop(Mailbox& box, std::uint64_t owner) {
  if (box.pop_holder != 0 && box.pop_holder != owner) return false;
  if (!mailbox_share(box, owner, nullptr)) return false;
  box.pop_holder = owner;
  return true;
}

void mailbox_release(Mailbox& box, std::uint64_t owner) {
  if (box.pop_holder == owner) box.pop_holder = 0;
  if (!box.sharers.empty()) {
    std::erase_if(box.sharers, [owner](const Mailbox::Sharer& s) { return s.owner == owner; });
    if (box.sharers.empty()) box.flags &= ~boxflag::in_use;
    return;
  }
  if ((box.flags & boxflag::in_use) && box.in_use_by == owner) {
    box.flags &= ~boxflag::in_use;
    box.in_use_by = 0;
  }
}

void mailbox_notify(Mailbox& box) {
  for (std::size_t i = 0; i < box.sharers.size(); ++i) {
    if (box.sharers[i].changed) box.sharers[i].changed();
  }
}

bool mailbox_forget(const std::string& path) {
  auto under = [&path](const Mailbox& b) {
    return b.path == path || (b.path.size() > path.size() && b.path.starts_with(path) && b.path[path.size()] == '/');
  };
  for (const auto& box : g_boxes) {
    if (under(box) && ((box.flags & boxflag::in_use) || box.appending || !box.staged.empty())) return false;
  }
  for (auto& box : g_boxes) {
    if (!under(box)) continue;
    compaction_abort(box);
    g_compact_failed.erase(&box);
  }
  g_boxes.remove_if(under);
  return true;
}

// ---- expunge ----------------------------------------------------------------

int mailbox_expunge(Mailbox& box, const std::function<bool(const MessageRecord&)>& only) {
  auto going = [&only](const MessageRecord& m) { return (m.flags & msgflag::deleted) && (!only || only(m)); };
  bool any = std::any_of(box.messages.begin(), box.messages.end(), going);
  if (!any) return 0;
  // Messages written but not yet committed are committed first, so that
  // the new mailbox keeps them.
  mailbox_commit_staged(box);
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
    if (going(m)) {
      if (run_length && !rc) rc = copy_range(old.get(), run_start, run_length, out.get());
      run_start = offset + m.total_length;
      run_length = 0;
    } else {
      run_length += m.total_length;
    }
    offset += m.total_length;
  }
  if (run_length && !rc) rc = copy_range(old.get(), run_start, run_length, out.get());
  // Whole messages appended behind the records by someone else (none while
  // the mark is held) stay; the rest of an interrupted append does not, and
  // nor do our own appends not yet committed, which start again.
  std::uint64_t tail = static_cast<std::uint64_t>(st.st_size) - offset;
  FileSource old_text(old.get());
  if (tail && (box.tail != box.bytes || box.appending || !whole_messages(old_text, offset))) tail = 0;
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
  appends_lost(box, EAGAIN);
  compaction_abort(box);

  // The overview learns which messages went (and takes in a tail of whole
  // messages); it is compacted later, in the background.
  std::string text;
  std::uint64_t gone_live = 0;
  std::erase_if(box.flags_pending, [&going](const MessageRecord* m) { return going(*m); });
  for (auto it = box.messages.begin(); it != box.messages.end();) {
    if (!going(*it)) {
      ++it;
      continue;
    }
    strappendf(text, "#expunge %u\n", it->uid);
    gone_live += entry_size(*it);
    count_out(box, *it);
    it = box.messages.erase(it);
  }
  auto last = box.messages.empty() ? box.messages.end() : std::prev(box.messages.end());
  if (tail) {
    UniqueFd now_fd;
    if (dir.open_file(leaf, O_RDONLY, now_fd).ok()) {
      FileSource in(std::move(now_fd));
      parse_all(box, in, mailbox_size(box));
    }
  }
  box.tail = box.bytes;
  box.changed = true;
  std::uint64_t added_live = 0;
  for (auto it = last == box.messages.end() ? box.messages.begin() : std::next(last); it != box.messages.end(); ++it) {
    append_entry(text, *it);
    added_live += entry_size(*it);
  }
  append_pending_flags(text, box);
  append_trailer(text, box);
  box.overview_live += added_live;
  box.overview_live -= std::min(gone_live, box.overview_live);
  // A small overview is written afresh at once, which costs no more than
  // the records would; a large one gets the records and is compacted later.
  if (box.overview_live <= kSmallOverview) {
    overview_write_whole(box);
  } else {
    overview_append(box, text);
  }
  mailbox_notify(box);
  return 0;
}

}  // namespace velmor
