// The IMAP server. Each connection is one ImapSession: it reads each
// command whole (quoted strings and literals in any argument; an APPEND's
// message goes to a temporary file), runs it, and answers it with one tagged
// reply before the next command is read, so pipelined commands wait their
// turn. Message data streams from the mailbox file as file ranges of the
// connection's output; a long FETCH goes on as the output drains.
//
// A selected mailbox is seen through the session's own view: its messages
// numbered from 1, each with the flags last shown to the client. Other
// sessions on the same mailbox, and delivery, change the mailbox under it;
// the mailbox tells every session that shares it, and the view catches up at
// the session's next command: new mail as EXISTS, flags as FETCH, messages
// expunged by another as EXPUNGE (never during FETCH, STORE or SEARCH, whose
// numbers must hold still).
#include "mail/imap_server.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "core/background.h"
#include "core/config.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/network.h"
#include "core/safedir.h"
#include "core/strfmt.h"
#include "core/tls.h"
#include "core/util.h"
#include "mail/imap_render.h"
#include "mail/imap_search.h"
#include "mail/imap_subscriptions.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"
#include "mail/queue_text.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

// A command with its small literals (an APPEND's message goes to a file).
constexpr std::size_t kCommandLimit = 64 * 1024;
// The largest APPEND when the user's group sets no mail.msg.size.
constexpr std::uint64_t kMessageCap = 64ull * 1024 * 1024;
constexpr std::chrono::milliseconds kFailedLoginDelay{1000};
constexpr int kFailedLoginLimit = 3;
// Commands one connection runs in a pass of the loop before the others are
// served (a client may pipeline thousands).
constexpr int kCommandsPerTurn = 16;
// What one slice of a SEARCH reads and compares, in bytes.
constexpr std::uint64_t kSearchSlice = 1024 * 1024;
// An APPEND or COPY that finds delivery writing into its mailbox tries again.
constexpr std::chrono::milliseconds kStoreRetry{50};
constexpr std::size_t kWriteChunk = 1024 * 1024;
constexpr int kListDepth = 16;
constexpr std::size_t kListEntries = 10000;
constexpr std::uint32_t kKept =
    msgflag::seen | msgflag::answered | msgflag::flagged | msgflag::deleted | msgflag::draft;
const char* const kCapabilities = "IMAP4rev1 IDLE UIDPLUS MOVE NAMESPACE SPECIAL-USE";
const char* const kPermanentFlags = "(\\Answered \\Flagged \\Deleted \\Seen \\Draft)";

std::string short_text(const std::string& value) { return value.substr(0, 200); }

// What may be echoed of a client's word in a reply.
std::string printable(std::string_view s) {
  std::string out(s.substr(0, 64));
  for (char& c : out) {
    if (static_cast<unsigned char>(c) < ' ' || static_cast<unsigned char>(c) > '~') c = '?';
  }
  return out;
}

std::string quoted(std::string_view s) {
  std::string o;
  imap_append_string(o, s);
  return o;
}

// ---- arguments --------------------------------------------------------------------

// The arguments of a command in their wire form: atoms, quoted strings
// ("\\" and "\"" escapes), literals "{n}" CR LF and n bytes, lists.
class Args {
 public:
  explicit Args(std::string_view text) : t_(text) {}
  bool end() const { return i_ >= t_.size(); }
  bool peek(char c) const { return i_ < t_.size() && t_[i_] == c; }
  bool eat(char c) {
    if (!peek(c)) return false;
    ++i_;
    return true;
  }
  bool space() { return eat(' '); }
  // A word up to a blank or a parenthesis (`wild` lets "%" and "*" in,
  // as list patterns need).
  std::string_view atom() {
    std::size_t from = i_;
    while (i_ < t_.size()) {
      auto u = static_cast<unsigned char>(t_[i_]);
      if (u <= ' ' || u == 0x7f || t_[i_] == '(' || t_[i_] == ')' || t_[i_] == '"' || t_[i_] == '{') break;
      ++i_;
    }
    return t_.substr(from, i_ - from);
  }
  // A quoted string or a literal.
  std::optional<std::string> string() {
    if (eat('"')) {
      std::string s;
      while (i_ < t_.size() && t_[i_] != '"') {
        char c = t_[i_++];
        if (c == '\r' || c == '\n') return std::nullopt;
        if (c == '\\' && i_ < t_.size() && (t_[i_] == '\\' || t_[i_] == '"')) c = t_[i_++];
        s += c;
      }
      if (!eat('"')) return std::nullopt;
      return s;
    }
    if (peek('{')) {
      std::size_t close = t_.find('}', i_);
      if (close == std::string_view::npos) return std::nullopt;
      std::uint64_t n = 0;
      auto r = std::from_chars(t_.data() + i_ + 1, t_.data() + close, n);
      if (r.ec != std::errc() || r.ptr != t_.data() + close || t_.substr(close + 1, 2) != "\r\n") return std::nullopt;
      std::size_t from = close + 3;
      if (n > t_.size() - std::min(from, t_.size())) return std::nullopt;
      i_ = from + static_cast<std::size_t>(n);
      return std::string(t_.substr(from, static_cast<std::size_t>(n)));
    }
    return std::nullopt;
  }
  // An atom, a quoted string or a literal.
  std::optional<std::string> astring() {
    if (peek('"') || peek('{')) return string();
    std::string_view a = atom();
    if (a.empty()) return std::nullopt;
    return std::string(a);
  }
  std::string_view rest() {
    std::string_view r = t_.substr(std::min(i_, t_.size()));
    i_ = t_.size();
    return r;
  }
  std::size_t position() const { return i_; }

 private:
  std::string_view t_;
  std::size_t i_ = 0;
};

// ---- sequence sets ----------------------------------------------------------------

using Range = SearchRange;

// A sequence set, "*" standing for `star`; the ranges sorted and joined.
// nullopt when malformed.
std::optional<std::vector<Range>> parse_set(std::string_view text, std::uint32_t star) {
  std::vector<Range> out;
  if (text.empty()) return std::nullopt;
  auto number = [&](std::string_view s) -> std::optional<std::uint32_t> {
    if (s == "*") return star;
    std::uint32_t n = 0;
    auto r = std::from_chars(s.data(), s.data() + s.size(), n);
    if (s.empty() || r.ec != std::errc() || r.ptr != s.data() + s.size() || n == 0) return std::nullopt;
    return n;
  };
  for (std::size_t from = 0; from <= text.size();) {
    std::size_t comma = text.find(',', from);
    std::string_view item = text.substr(from, comma == std::string_view::npos ? std::string_view::npos : comma - from);
    std::size_t colon = item.find(':');
    auto a = number(item.substr(0, colon));
    auto b = colon == std::string_view::npos ? a : number(item.substr(colon + 1));
    if (!a || !b) return std::nullopt;
    out.push_back({std::min(*a, *b), std::max(*a, *b)});
    if (comma == std::string_view::npos) break;
    from = comma + 1;
  }
  std::sort(out.begin(), out.end(), [](const Range& x, const Range& y) { return x.low < y.low; });
  std::vector<Range> joined;
  for (const Range& r : out) {
    if (!joined.empty() && r.low <= joined.back().high + 1ULL) {
      joined.back().high = std::max(joined.back().high, r.high);
    } else {
      joined.push_back(r);
    }
  }
  return joined;
}

bool in_set(const std::vector<Range>& set, std::uint32_t n) {
  auto it = std::upper_bound(set.begin(), set.end(), n, [](std::uint32_t v, const Range& r) { return v < r.low; });
  return it != set.begin() && std::prev(it)->high >= n;
}

// Identifiers as a set, in the order given: runs of consecutive ones as
// "low:high" (COPYUID pairs the source's with the target's by position).
std::string uid_text(const std::vector<std::uint32_t>& uids) {
  std::string out;
  for (std::size_t i = 0; i < uids.size();) {
    std::size_t j = i;
    while (j + 1 < uids.size() && uids[j + 1] == uids[j] + 1) ++j;
    if (!out.empty()) out += ',';
    out += j == i ? std::to_string(uids[i]) : strprintf("%u:%u", uids[i], uids[j]);
    i = j + 1;
  }
  return out;
}

// ---- dates ----------------------------------------------------------------------------

// "1-Feb-2026" as a day number (days since 1970 of that calendar date).
std::optional<std::int64_t> parse_day(std::string_view s) {
  static const char* const kMonths[] = {"jan", "feb", "mar", "apr", "may", "jun",
                                        "jul", "aug", "sep", "oct", "nov", "dec"};
  std::size_t d1 = s.find('-'), d2 = s.find('-', d1 == std::string_view::npos ? s.size() : d1 + 1);
  if (d1 == std::string_view::npos || d2 == std::string_view::npos) return std::nullopt;
  int day = 0, year = 0;
  auto r1 = std::from_chars(s.data(), s.data() + d1, day);
  auto r2 = std::from_chars(s.data() + d2 + 1, s.data() + s.size(), year);
  if (r1.ec != std::errc() || r1.ptr != s.data() + d1 || r2.ec != std::errc() || r2.ptr != s.data() + s.size())
    return std::nullopt;
  std::string_view mon = s.substr(d1 + 1, d2 - d1 - 1);
  int month = -1;
  for (int m = 0; m < 12; ++m) {
    if (str_iequals(mon, kMonths[m])) month = m;
  }
  if (month < 0 || day < 1 || day > 31 || year < 1900 || year > 9999) return std::nullopt;
  return imap_day_number(year, month, day);
}

// An APPEND date-time "dd-Mon-yyyy hh:mm:ss +zzzz"; nullopt when malformed.
std::optional<std::time_t> parse_date_time(std::string_view s) {
  while (!s.empty() && s.front() == ' ') s.remove_prefix(1);
  std::size_t blank = s.find(' ');
  if (blank == std::string_view::npos) return std::nullopt;
  auto day = parse_day(s.substr(0, blank));
  std::string_view rest = s.substr(blank + 1);
  int hh = 0, mm = 0, ss = 0, zone = 0;
  if (!day || rest.size() != 14 || rest[2] != ':' || rest[5] != ':' || rest[8] != ' ' ||
      (rest[9] != '+' && rest[9] != '-'))
    return std::nullopt;
  auto num = [&](std::size_t at, std::size_t n, int& v) {
    auto r = std::from_chars(rest.data() + at, rest.data() + at + n, v);
    return r.ec == std::errc() && r.ptr == rest.data() + at + n;
  };
  if (!num(0, 2, hh) || !num(3, 2, mm) || !num(6, 2, ss) || !num(10, 4, zone) || hh > 23 || mm > 59 || ss > 60)
    return std::nullopt;
  std::int64_t offset = (zone / 100) * 3600 + (zone % 100) * 60;
  if (rest[9] == '-') offset = -offset;
  return static_cast<std::time_t>(*day * 86400 + hh * 3600 + mm * 60 + ss - offset);
}

// ---- names and patterns ----------------------------------------------------------

// IMAP list wildcards: "*" any run, "%" any run without "/".
bool wild_match(std::string_view s, std::string_view p) {
  std::size_t si = 0, pi = 0, star_p = std::string_view::npos, star_s = 0;
  bool star_any = false;
  while (si < s.size()) {
    if (pi < p.size() && (p[pi] == '*' || p[pi] == '%')) {
      star_any = p[pi] == '*';
      star_p = pi++;
      star_s = si;
    } else if (pi < p.size() && p[pi] == s[si]) {
      ++pi;
      ++si;
    } else if (star_p != std::string_view::npos && (star_any || s[star_s] != '/')) {
      pi = star_p + 1;
      si = ++star_s;
    } else {
      return false;
    }
  }
  while (pi < p.size() && (p[pi] == '*' || p[pi] == '%')) ++pi;
  return pi == p.size();
}

// Whether the listed name matches, "INBOX" in any case.
bool list_match(std::string_view name, std::string_view pattern) {
  if (name == "INBOX" && pattern.size() >= 5 && str_istarts_with(pattern, "INBOX"))
    return wild_match(name, "INBOX" + std::string(pattern.substr(5)));
  return wild_match(name, pattern);
}

// The attribute that tells clients what a box is for, by its name.
std::string special_use(std::string_view name) {
  for (const char* use : {"Sent", "Drafts", "Trash", "Junk"}) {
    if (name == use) return std::string("\\") + use;
  }
  return {};
}

// ---- output ----------------------------------------------------------------------------

// The connection as an ImapSink: text is sent, file ranges stream from the
// session's mailbox descriptor.
class ConnectionSink final : public ImapSink {
 public:
  ConnectionSink(Connection& c, std::shared_ptr<const UniqueFd> file) : c_(c), file_(std::move(file)) {}
  void text(std::string_view bytes) override { c_.send(bytes); }
  void file_range(std::uint64_t offset, std::uint64_t length, bool unstuff) override {
    c_.send_file({.file = file_,
                  .offset = offset,
                  .length = length,
                  .transform = unstuff ? FileRange::Transform::dot_unstuff : FileRange::Transform::none,
                  .failure_text = "\r\n* BYE the mailbox could not be read\r\n"});
  }

 private:
  Connection& c_;
  std::shared_ptr<const UniqueFd> file_;
};

// Writes a message into a mailbox file at an offset, a megabyte at a time.
class Writer {
 public:
  Writer(int fd, std::uint64_t at) : fd_(fd), at_(at) {}
  void put(std::string_view s) {
    if (rc_) return;
    buf_.append(s);
    if (buf_.size() >= kWriteChunk) flush();
  }
  // Bytes of a source, as they are.
  void copy(ByteSource& in, std::uint64_t from, std::uint64_t length) {
    while (length > 0 && !rc_) {
      std::string_view v = in.view(from, static_cast<std::size_t>(std::min<std::uint64_t>(length, kWriteChunk)));
      if (v.empty()) {
        rc_ = EIO;
        return;
      }
      v = v.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(v.size(), length)));
      put(v);
      from += v.size();
      length -= v.size();
    }
  }
  int finish() {
    flush();
    return rc_;
  }
  std::uint64_t end() const { return at_ + buf_.size(); }

 private:
  void flush() {
    if (rc_ || buf_.empty()) return;
    rc_ = pwrite_all(fd_, buf_, at_);
    at_ += buf_.size();
    buf_.clear();
  }
  int fd_;
  std::uint64_t at_;
  std::string buf_;
  int rc_ = 0;
};

// The lines a stored message carries about itself: its flags ("Status:",
// "X-Status:", 32 bytes as the mailbox format has them) and identifier.
std::string status_block(std::uint32_t flags, std::uint32_t uid) {
  return strprintf("Status:     %c\r\nX-Status:    %c%c\r\nX-UID: %u\r\n\r\n", flags & msgflag::seen ? 'R' : ' ',
                   flags & msgflag::deleted ? 'D' : ' ', flags & msgflag::answered ? 'A' : ' ', uid);
}

// Header lines a copied or appended message loses: what carries mailbox state.
bool state_line(std::string_view line, bool appended) {
  if (appended) return mailbox_header_dropped(line);
  return str_istarts_with(line, "Status:") || str_istarts_with(line, "X-Status:") || str_istarts_with(line, "X-UID:") ||
         str_istarts_with(line, "X-UIDL:");
}

// A message as a client gave it (APPEND) in the form delivery stores: its
// header without the lines that carry mailbox state, the status block and
// identifier, the body with every line that starts with "." stuffed and
// every line ending in CR LF, and the closing "." line.
void write_appended(Writer& w, ByteSource& raw, std::uint32_t flags, std::uint32_t uid) {
  bool header = true, dropping = false;
  for (std::uint64_t pos = 0; pos < raw.size();) {
    Line line = read_line(raw, pos, 64);
    if (line.length == 0) break;
    // What is needed of the line's text is taken before the source is read
    // again (a later view may replace the text).
    const std::uint64_t len = line.length;
    const char first = line.text.front();
    const bool folded = first == ' ' || first == '\t';
    const bool state = header && !folded && state_line(line.text, true);
    std::string tail(len <= line.text.size()
                         ? line.text.substr(line.text.size() - std::min<std::size_t>(line.text.size(), 2))
                         : raw.view(pos + len - 2, 2));
    std::uint64_t content = len;
    if (tail.size() == 2 && tail[1] == '\n') {
      content -= tail[0] == '\r' ? 2 : 1;
    } else if (!tail.empty() && tail.back() == '\n') {
      content -= 1;
    }
    if (header) {
      if (content == 0) {
        header = false;
        w.put(status_block(flags, uid));
        pos += len;
        continue;
      }
      if (!folded) dropping = state;
      if (dropping) {
        pos += len;
        continue;
      }
    }
    if (first == '.') w.put(".");
    w.copy(raw, pos, content);
    w.put("\r\n");
    pos += len;
  }
  if (header) w.put(status_block(flags, uid));
  w.put(".\r\n");
}

// A stored message copied into another mailbox: its separator and header
// as they are but for the lines that carry mailbox state, a status block
// and identifier of its own, its body (already in transmission form).
void write_copied(Writer& w, ByteSource& in, const MessageRecord& m, std::uint64_t offset, std::uint32_t flags,
                  std::uint32_t uid) {
  std::uint64_t sep = m.total_length - m.length;
  std::uint64_t body = std::clamp<std::uint64_t>(m.header_length, sep, m.total_length);
  w.copy(in, offset, sep);
  bool dropping = false;
  for (std::uint64_t pos = offset + sep; pos < offset + body;) {
    Line line = read_line(in, pos, 64);
    if (line.length == 0) break;
    std::uint64_t len = std::min(line.length, offset + body - pos);
    if (line_body(line.text).empty()) break;  // the blank line that ends the header
    bool folded = line.text.front() == ' ' || line.text.front() == '\t';
    if (!folded) dropping = state_line(line.text, false);
    if (!dropping) w.copy(in, pos, len);
    pos += len;
  }
  w.put(status_block(flags, uid));
  w.copy(in, offset + body, m.total_length - body);
  if (m.end_line == 0) {
    // a damaged message without its "." line gets one
    std::string_view last = in.view(offset + m.total_length - std::min<std::uint64_t>(m.total_length, 1), 1);
    if (!last.empty() && last.back() != '\n') w.put("\r\n");
    w.put(".\r\n");
  }
}

// ---- the session -----------------------------------------------------------------

class ImapSession final : public Session {
 public:
  void on_open(Connection& c) override;
  void on_input(Connection& c) override;
  void on_drained(Connection& c) override;
  void on_timer(Connection& c) override;
  void on_close(Connection& c, CloseReason) override;

 private:
  enum class Auth { none, authenticated };
  enum class Wait { none, login, store };

  // One message of the view.
  struct Entry {
    MessageRecord* rec = nullptr;  // nullptr: expunged by another, not yet reported
    std::uint32_t uid = 0;
    std::uint64_t offset = 0;  // where it starts in the file the session reads
    std::uint32_t shown = 0;   // the flags last shown (kKept bits)
    bool recent = false;
  };

  // A command in progress that goes on as the output drains (FETCH).
  struct Stream {
    std::string tag;
    FetchRequest request;
    std::vector<std::size_t> targets;  // view positions
    std::size_t next = 0;
    bool uid_mode = false, missing = false;
  };

  // A command handler; false leaves the reply to a later call (it waits).
  using Handler = void (ImapSession::*)(Connection&, const std::string& tag, Args&, bool uid);
  struct Command {
    const char* name;
    Handler run;
    enum Needs { any, authenticated, selected } needs;
    bool uid_form;  // may follow "UID"
  };
  static const Command kCommands[];

  // Reading commands.
  void read_commands(Connection& c);
  bool literal_bytes(Connection& c);
  void line_complete(Connection& c, std::string_view line);
  bool literal_announced(Connection& c, std::string_view line);
  void execute(Connection& c);
  void gated(Connection& c);
  void reset_command();

  // The view.
  void select_box(Connection& c, Mailbox* box, bool read_only);
  void deselect(Connection& c);
  void remerge();
  void sync(Connection& c, bool expunges);
  bool reopen();
  std::size_t recent_count() const {
    return static_cast<std::size_t>(std::count_if(view_.begin(), view_.end(), [](const Entry& e) { return e.recent; }));
  }
  std::uint32_t view_flags(const Entry& e) const {
    return (e.rec ? e.rec->flags & kKept : e.shown) | (e.recent ? msgflag::recent : 0);
  }
  // The view positions a set names, ascending; nullopt (BAD) when a message
  // number lies past the end.
  std::optional<std::vector<std::size_t>> resolve(std::string_view set, bool uid_mode);
  // The same for a command's set, once the view has caught up (expunges
  // held back); BAD when the set is no good.
  std::optional<std::vector<std::size_t>> targets_of(Connection& c, const std::string& tag, std::string_view set,
                                                     bool uid_mode);

  // Names.
  std::string path_of(std::string_view name) const { return mailbox_path_for_name(home_, name); }
  std::string rel_of(std::string_view name) const {
    return str_iequals(name, "INBOX") ? "mail/inbox" : std::string(name);
  }
  bool name_checked(Connection& c, const std::string& tag, std::string_view name, bool folder = false);
  // The one argument of a command that takes a mailbox name; BAD otherwise.
  static std::optional<std::string> one_name(Connection& c, const std::string& tag, Args& a);
  Mailbox* open_box(std::string_view name, bool create_inbox);

  // Commands.
  void cmd_capability(Connection&, const std::string&, Args&, bool);
  void cmd_noop(Connection&, const std::string&, Args&, bool);
  void cmd_logout(Connection&, const std::string&, Args&, bool);
  void cmd_login(Connection&, const std::string&, Args&, bool);
  void cmd_starttls(Connection&, const std::string&, Args&, bool);
  void cmd_select(Connection&, const std::string&, Args&, bool);
  void cmd_examine(Connection&, const std::string&, Args&, bool);
  void cmd_create(Connection&, const std::string&, Args&, bool);
  void cmd_delete(Connection&, const std::string&, Args&, bool);
  void cmd_rename(Connection&, const std::string&, Args&, bool);
  void cmd_subscribe(Connection&, const std::string&, Args&, bool);
  void cmd_unsubscribe(Connection&, const std::string&, Args&, bool);
  void cmd_list(Connection&, const std::string&, Args&, bool);
  void cmd_lsub(Connection&, const std::string&, Args&, bool);
  void cmd_find(Connection&, const std::string&, Args&, bool);
  void cmd_status(Connection&, const std::string&, Args&, bool);
  void cmd_append(Connection&, const std::string&, Args&, bool);
  void cmd_check(Connection&, const std::string&, Args&, bool);
  void cmd_close(Connection&, const std::string&, Args&, bool);
  void cmd_expunge(Connection&, const std::string&, Args&, bool);
  void cmd_search(Connection&, const std::string&, Args&, bool);
  void cmd_fetch(Connection&, const std::string&, Args&, bool);
  void cmd_store(Connection&, const std::string&, Args&, bool);
  void cmd_copy(Connection&, const std::string&, Args&, bool);
  void cmd_move(Connection&, const std::string&, Args&, bool);
  void cmd_idle(Connection&, const std::string&, Args&, bool);
  void cmd_namespace(Connection&, const std::string&, Args&, bool);
  void idle_line(Connection& c, std::string_view line);

  void select_common(Connection& c, const std::string& tag, Args& a, bool read_only);
  void stream_more(Connection& c);
  void list_names(std::string_view pattern, const std::function<void(const std::string&, bool folder)>& emit);
  // Messages written into `name` by `write` (called per message with the
  // writer, its identifier and its index); whole or not at all. 0 or an
  // errno value; EAGAIN while delivery is writing into the mailbox.
  int store_messages(std::string_view name, std::size_t count,
                     const std::function<std::uint32_t(Writer&, std::uint32_t uid, std::size_t i)>& write);
  void finish_append(Connection& c);
  void finish_copy(Connection& c);

  // Search: the keys read into a query (counted against the limits), then
  // run a slice at a time; one that is not done in its first slice goes on
  // in the background while the connection's input waits.
  struct SearchBuild {
    SearchQuery query;
    std::size_t keys = 0;
    bool over_limit = false;
  };
  struct SearchJob {
    std::string tag;
    bool uid_mode = false;
    SearchRun run;
  };
  bool search_keys(Args& a, std::vector<SearchKey>& out, int depth, SearchBuild& b);
  bool search_key(Args& a, SearchKey& out, int depth, SearchBuild& b);
  bool search_step(Connection& c);

  // Who.
  Auth auth_ = Auth::none;
  std::string user_, home_;
  int failed_logins_ = 0;
  std::optional<Subscriptions> subscriptions_;  // the user's, from login on

  // The command being read.
  std::string cmd_;  // in wire form, literals included
  std::uint64_t literal_left_ = 0;
  std::uint64_t discard_left_ = 0;  // bytes of a refused literal the client sent anyway
  bool to_file_ = false;            // the literal is an APPEND's message
  UniqueFd append_file_;            // ... received here
  std::uint64_t append_size_ = 0;
  std::string append_head_;  // the APPEND command up to its message
  std::string append_rest_;  // and what followed it
  Wait wait_ = Wait::none;
  std::string wait_tag_;
  int turn_commands_ = 0;  // lines read in this pass of the loop

  // The selected mailbox.
  Mailbox* box_ = nullptr;
  bool read_only_ = false;
  bool stale_ = false;    // the mailbox changed since the view last caught up
  bool recheck_ = false;  // flags may differ from those shown
  std::uint64_t epoch_ = 0;
  std::shared_ptr<const UniqueFd> file_;
  std::unique_ptr<FileSource> source_;
  std::vector<Entry> view_;
  std::size_t gone_ = 0;              // entries expunged by another, not yet reported
  std::size_t announced_ = 0;         // the count the client was last told (EXISTS)
  std::size_t announced_recent_ = 0;  // ... and of recent messages
  std::unique_ptr<Stream> stream_;
  std::unique_ptr<SearchJob> search_;
  BackgroundWork search_work_;

  // COPY (or MOVE) waiting for delivery to finish writing.
  std::string copy_target_;
  std::vector<std::size_t> copy_targets_;
  bool moving_ = false;

  // IDLE: changes to the selected mailbox are sent as they happen (the
  // mailbox's note wakes the connection) until the client says DONE.
  Connection* conn_ = nullptr;
  bool idling_ = false;
  std::string idle_tag_;
};

const ImapSession::Command ImapSession::kCommands[] = {
    {"CAPABILITY", &ImapSession::cmd_capability, Command::any, false},
    {"NOOP", &ImapSession::cmd_noop, Command::any, false},
    {"LOGOUT", &ImapSession::cmd_logout, Command::any, false},
    {"LOGIN", &ImapSession::cmd_login, Command::any, false},
    {"STARTTLS", &ImapSession::cmd_starttls, Command::any, false},
    {"SELECT", &ImapSession::cmd_select, Command::authenticated, false},
    {"EXAMINE", &ImapSession::cmd_examine, Command::authenticated, false},
    {"CREATE", &ImapSession::cmd_create, Command::authenticated, false},
    {"DELETE", &ImapSession::cmd_delete, Command::authenticated, false},
    {"RENAME", &ImapSession::cmd_rename, Command::authenticated, false},
    {"SUBSCRIBE", &ImapSession::cmd_subscribe, Command::authenticated, false},
    {"UNSUBSCRIBE", &ImapSession::cmd_unsubscribe, Command::authenticated, false},
    {"LIST", &ImapSession::cmd_list, Command::authenticated, false},
    {"LSUB", &ImapSession::cmd_lsub, Command::authenticated, false},
    {"FIND", &ImapSession::cmd_find, Command::authenticated, false},
    {"STATUS", &ImapSession::cmd_status, Command::authenticated, false},
    {"APPEND", &ImapSession::cmd_append, Command::authenticated, false},
    {"CHECK", &ImapSession::cmd_check, Command::selected, false},
    {"CLOSE", &ImapSession::cmd_close, Command::selected, false},
    {"EXPUNGE", &ImapSession::cmd_expunge, Command::selected, true},
    {"SEARCH", &ImapSession::cmd_search, Command::selected, true},
    {"FETCH", &ImapSession::cmd_fetch, Command::selected, true},
    {"STORE", &ImapSession::cmd_store, Command::selected, true},
    {"COPY", &ImapSession::cmd_copy, Command::selected, true},
    {"MOVE", &ImapSession::cmd_move, Command::selected, true},
    {"IDLE", &ImapSession::cmd_idle, Command::authenticated, false},
    {"NAMESPACE", &ImapSession::cmd_namespace, Command::authenticated, false},
};

void ImapSession::on_open(Connection& c) {
  conn_ = &c;
  c.send(strprintf("* OK %s Velmor Server Suite IMAP4 Server (v%s %s) ready at %s - Report problems to %s\r\n",
                   short_text(text_of(config.server_name)).c_str(), kVersion, kPlatform,
                   time_text(server_now ? server_now : std::time(nullptr)).c_str(),
                   short_text(text_of(config.admin_email)).c_str()));
}

void ImapSession::on_close(Connection& c, CloseReason) {
  search_work_ = BackgroundWork();
  search_.reset();
  deselect(c);
  append_file_.close();
}

void ImapSession::on_input(Connection& c) {
  turn_commands_ = 0;  // a new pass of the loop
  if (stream_) stream_more(c);
  read_commands(c);
}

void ImapSession::on_drained(Connection& c) {
  if (stream_) stream_more(c);
  if (!stream_ && wait_ == Wait::none) read_commands(c);
}

void ImapSession::on_timer(Connection& c) {
  if (idling_) {
    sync(c, true);  // the mailbox changed under an idle client: it hears now
    return;
  }
  Wait w = wait_;
  wait_ = Wait::none;
  c.resume_input();
  if (w == Wait::login) {
    c.send(wait_tag_ + " NO Bad LOGIN user name/password\r\n");
    if (failed_logins_ >= kFailedLoginLimit) {
      c.close_after_send();
      return;
    }
  } else if (w == Wait::store) {
    if (!append_head_.empty()) {
      finish_append(c);
    } else {
      finish_copy(c);
    }
    if (wait_ != Wait::none) return;
  }
  read_commands(c);
}

// The output is full or input paused: the connection offers the input
// again once that passes (read_line notes that it was held back).
void ImapSession::gated(Connection& c) {
  std::string_view ignored;
  if (c.output_full()) c.read_line(ignored);
}

void ImapSession::reset_command() {
  cmd_.clear();
  literal_left_ = 0;
  to_file_ = false;
  append_file_.close();
  append_size_ = 0;
  append_head_.clear();
}

// Bytes of a literal still to come; false when the input has no more now.
bool ImapSession::literal_bytes(Connection& c) {
  std::string_view b = c.buffered();
  if (b.empty()) return false;
  std::uint64_t& left = discard_left_ ? discard_left_ : literal_left_;
  std::size_t n = static_cast<std::size_t>(std::min<std::uint64_t>(b.size(), left));
  if (&left == &literal_left_) {
    if (to_file_) {
      if (write_all(append_file_.get(), b.substr(0, n)) != 0) {
        // The temporary file failed: the message is refused once it is in.
        append_file_.close();
      }
    } else {
      cmd_.append(b.substr(0, n));
    }
  }
  c.consume(n);
  left -= n;
  return true;
}

void ImapSession::read_commands(Connection& c) {
  while (!c.closed() && wait_ == Wait::none && !stream_ && !c.input_paused()) {
    if (discard_left_ || literal_left_) {
      if (!literal_bytes(c)) return;
      continue;
    }
    if (c.output_full()) {
      gated(c);
      return;
    }
    if (cmd_.empty() && turn_commands_ >= kCommandsPerTurn) {
      c.yield_turn();  // the others have their turn; this goes on at the next pass
      return;
    }
    // The tag of the line, should the line turn out too long.
    std::string tag;
    if (cmd_.empty()) {
      std::string_view b = c.buffered();
      tag = printable(b.substr(0, b.find_first_of(" \r\n")));
    } else {
      tag = printable(cmd_.substr(0, cmd_.find(' ')));
    }
    std::string_view line;
    LineResult r = c.read_line(line);
    if (r == LineResult::need_more) return;
    ++turn_commands_;
    if (r == LineResult::overlong) {
      c.send((tag.empty() ? std::string("*") : tag) + " BAD command line too long\r\n");
      reset_command();
      continue;
    }
    line_complete(c, line);
  }
}

// A line of a command: it ends the command, or announces a literal.
void ImapSession::line_complete(Connection& c, std::string_view line) {
  if (cmd_.empty() && line.empty()) return;  // an empty line between commands
  if (idling_) return idle_line(c, line);
  if (cmd_.size() + line.size() > kCommandLimit) {
    c.send(cmd_.empty() ? std::string("*") : printable(cmd_.substr(0, cmd_.find(' '))));
    c.send(" BAD command too long\r\n");
    reset_command();
    return;
  }
  cmd_.append(line);
  if (line.size() >= 3 && line.back() == '}') {
    if (literal_announced(c, line)) return;
    // refused: the reply is sent; nothing more of this command is read
    return;
  }
  execute(c);
  reset_command();
}

// "{n}" at the end of a line: the literal is accepted (the client is told
// to go on unless it already did) or refused. True when accepted.
bool ImapSession::literal_announced(Connection& c, std::string_view line) {
  std::size_t open = line.rfind('{');
  if (open == std::string_view::npos) open = line.size() - 1;
  std::string_view count = line.substr(open + 1, line.size() - open - 2);
  if (!count.empty() && count.back() == '+') count.remove_suffix(1);  // a non-synchronizing literal
  std::string tag = printable(cmd_.substr(0, cmd_.find(' ')));
  std::uint64_t n = 0;
  auto r = std::from_chars(count.data(), count.data() + count.size(), n);
  bool digits = !count.empty() && r.ec == std::errc() && r.ptr == count.data() + count.size() && count.size() <= 12;
  if (!digits) {
    c.send(tag + " BAD Invalid size argument\r\n");
    reset_command();
    return false;
  }
  // Is it an APPEND's message? The mailbox name is then already given.
  const std::size_t head = cmd_.size() - (line.size() - open);
  bool message = false;
  {
    Args a(std::string_view(cmd_).substr(0, head));
    a.atom();
    a.space();
    message = str_iequals(a.atom(), "APPEND") && a.space() && a.astring();
  }
  if (message) {
    std::uint64_t limit = kMessageCap;
    if (const auto& g = c.group(); g && g->size("mail.msg.size")) limit = g->size("mail.msg.size");
    if (auth_ != Auth::authenticated) {
      c.send(tag + " BAD Not in correct auth state\r\n");
    } else if (n == 0) {
      c.send(tag + " BAD Invalid size argument\r\n");
    } else if (n > limit) {
      c.send(strprintf("%s NO [TOOBIG] message larger than %llu bytes\r\n", tag.c_str(),
                       static_cast<unsigned long long>(limit)));
    } else {
      // The message goes to a temporary file, which has no name once made.
      std::string tmpl = path_join(paths.tmp_dir, "imap-append-XXXXXX");
      int fd = ::mkstemp(tmpl.data());
      if (fd >= 0) {
        ::unlink(tmpl.c_str());
        append_file_ = UniqueFd(fd);
        append_head_ = cmd_.substr(0, head);
        append_size_ = n;
        to_file_ = true;
        literal_left_ = n;
        cmd_.resize(head);
        if (c.buffered().empty()) c.send("+ Ready for message body\r\n");
        return true;
      }
      c.send(tag + " NO [SERVERBUG] no room for the message\r\n");
    }
    discard_left_ = c.buffered().empty() ? 0 : n;  // a client that did not wait for us
    reset_command();
    return false;
  }
  if (cmd_.size() + n > kCommandLimit) {
    c.send(tag + " BAD command too long\r\n");
    discard_left_ = c.buffered().empty() ? 0 : n;
    reset_command();
    return false;
  }
  cmd_ += "\r\n";
  literal_left_ = n;
  if (c.buffered().empty()) c.send("+ Ready for literal data\r\n");
  return true;
}

void ImapSession::execute(Connection& c) {
  if (to_file_) {
    append_rest_ = cmd_.substr(append_head_.size());  // what followed the message
    finish_append(c);
    return;
  }
  Args a(cmd_);
  std::string tag(a.atom());
  if (tag.empty() || !a.space()) {
    c.send(tag.empty() ? "* BAD Unknown command\r\n" : tag + " BAD Unknown command\r\n");
    return;
  }
  std::string_view verb = a.atom();
  bool uid = false;
  if (str_iequals(verb, "UID")) {
    uid = true;
    verb = a.space() ? a.atom() : std::string_view{};
    if (verb.empty()) {
      c.send(tag + " BAD Unknown command\r\n");
      return;
    }
  }
  if (verb.empty()) {
    c.send(tag + " BAD Unknown command\r\n");
    return;
  }
  const Command* command = nullptr;
  for (const Command& k : kCommands) {
    if (str_iequals(verb, k.name) && (!uid || k.uid_form)) command = &k;
  }
  if (!command) {
    c.send(tag + " BAD Unknown command `" + printable(verb) + "'\r\n");
    return;
  }
  if (command->needs != Command::any && auth_ != Auth::authenticated) {
    c.send(tag + " BAD Not in correct auth state\r\n");
    return;
  }
  if (command->needs == Command::selected && !box_) {
    c.send(tag + " BAD No mailbox selected\r\n");
    return;
  }
  a.space();
  (this->*command->run)(c, tag, a, uid);
}

// ---- the view -------------------------------------------------------------------

bool ImapSession::reopen() {
  UniqueFd fd = mailbox_open(*box_);
  if (!fd) return false;
  file_ = std::make_shared<const UniqueFd>(std::move(fd));
  source_ = std::make_unique<FileSource>(file_->get());
  epoch_ = box_->epoch;
  return true;
}

void ImapSession::select_box(Connection& c, Mailbox* box, bool read_only) {
  box_ = box;
  read_only_ = read_only;
  stale_ = false;
  mailbox_share(*box, c.id(), [this] {
    stale_ = true;
    if (idling_) conn_->wake_after(std::chrono::milliseconds(1));
  });
  reopen();
  view_.clear();
  view_.reserve(box->messages.size());
  std::uint64_t off = 0;
  for (auto& m : box->messages) {
    bool recent = m.uid > box->recent_uid;
    view_.push_back({&m, m.uid, off, m.flags & kKept, recent});
    off += m.total_length;
  }
  if (!read_only && !box->messages.empty()) box->recent_uid = std::max(box->recent_uid, box->messages.back().uid);
  gone_ = 0;
  announced_ = view_.size();
  announced_recent_ = recent_count();
}

void ImapSession::deselect(Connection& c) {
  stream_.reset();
  if (box_) {
    mailbox_overview_flush(*box_);  // flags changed reach the overview now
    mailbox_release(*box_, c.id());
  }
  box_ = nullptr;
  view_.clear();
  source_.reset();
  file_.reset();
}

// Brings the view's records, offsets and descriptor in line with the
// mailbox: kept messages found by identifier, the ones gone marked, new ones
// added at the end. Nothing is told to the client here.
void ImapSession::remerge() {
  stale_ = false;
  recheck_ = true;
  gone_ = 0;
  std::vector<Entry> fresh;
  fresh.reserve(std::max(view_.size(), box_->messages.size()));
  auto it = box_->messages.begin();
  std::uint64_t off = 0;
  for (Entry& e : view_) {
    while (it != box_->messages.end() && it->uid < e.uid) {
      off += it->total_length;
      ++it;
    }
    if (it != box_->messages.end() && it->uid == e.uid) {
      e.rec = &*it;
      e.offset = off;
      off += it->total_length;
      ++it;
    } else {
      e.rec = nullptr;
    }
    if (!e.rec) ++gone_;
    fresh.push_back(e);
  }
  for (; it != box_->messages.end(); ++it) {
    bool recent = it->uid > box_->recent_uid;
    if (recent && !read_only_) box_->recent_uid = it->uid;
    fresh.push_back({&*it, it->uid, off, it->flags & kKept, recent});
    off += it->total_length;
  }
  view_ = std::move(fresh);
  if (box_->epoch != epoch_ || !file_) {
    reopen();
  } else if (source_) {
    source_->refresh();
  }
}

// What changed is told: flags others changed, expunges (unless
// `expunges` is false: FETCH, STORE and SEARCH keep their numbers), new
// messages.
void ImapSession::sync(Connection& c, bool expunges) {
  if (!box_) return;
  std::string out;
  if (stale_) remerge();
  if (recheck_) {
    recheck_ = false;
    for (std::size_t i = 0; i < view_.size(); ++i) {
      Entry& e = view_[i];
      if (e.rec && (e.rec->flags & kKept) != e.shown) {
        e.shown = e.rec->flags & kKept;
        strappendf(out, "* %zu FETCH (UID %u FLAGS %s)\r\n", i + 1, e.uid, imap_flag_list(view_flags(e)).c_str());
      }
    }
  }
  if (expunges && gone_) {
    std::size_t removed = 0;
    std::vector<Entry> kept;
    kept.reserve(view_.size());
    for (std::size_t i = 0; i < view_.size(); ++i) {
      if (view_[i].rec) {
        kept.push_back(view_[i]);
      } else {
        strappendf(out, "* %zu EXPUNGE\r\n", i + 1 - removed);
        ++removed;
      }
    }
    view_ = std::move(kept);
    announced_ -= std::min(announced_, removed);
    gone_ = 0;
  }
  if (view_.size() != announced_) {
    announced_ = view_.size();
    strappendf(out, "* %zu EXISTS\r\n", announced_);
  }
  std::size_t recent = recent_count();
  if (recent != announced_recent_) {
    announced_recent_ = recent;
    strappendf(out, "* %zu RECENT\r\n", recent);
  }
  c.send(out);
}

std::optional<std::vector<std::size_t>> ImapSession::resolve(std::string_view text, bool uid_mode) {
  std::vector<std::size_t> out;
  if (!uid_mode) {
    if (view_.empty() && text.find('*') != std::string_view::npos) return out;  // "1:*" of an empty mailbox
    auto set = parse_set(text, static_cast<std::uint32_t>(view_.size()));
    if (!set) return std::nullopt;
    for (const Range& r : *set) {
      if (r.high > view_.size()) return std::nullopt;  // past the end: nothing is done
      for (std::uint64_t n = r.low; n <= r.high; ++n) out.push_back(static_cast<std::size_t>(n - 1));
    }
    return out;
  }
  std::uint32_t highest = view_.empty() ? 0 : view_.back().uid;
  auto set = parse_set(text, highest ? highest : 0xffffffffu);
  if (!set) return std::nullopt;
  for (const Range& r : *set) {
    auto from =
        std::lower_bound(view_.begin(), view_.end(), r.low, [](const Entry& e, std::uint32_t u) { return e.uid < u; });
    for (auto it = from; it != view_.end() && it->uid <= r.high; ++it) {
      out.push_back(static_cast<std::size_t>(it - view_.begin()));
    }
  }
  return out;
}

std::optional<std::vector<std::size_t>> ImapSession::targets_of(Connection& c, const std::string& tag,
                                                                std::string_view set, bool uid_mode) {
  sync(c, false);
  auto targets = resolve(set, uid_mode);
  if (!targets) c.send(tag + " BAD Invalid message set\r\n");
  return targets;
}

// ---- names -------------------------------------------------------------------------

bool ImapSession::name_checked(Connection& c, const std::string& tag, std::string_view name, bool folder) {
  if (str_iequals(name, "INBOX") || imap_name_allowed(name, false, folder)) return true;
  c.send(tag + " NO Invalid mailbox name\r\n");
  return false;
}

std::optional<std::string> ImapSession::one_name(Connection& c, const std::string& tag, Args& a) {
  auto name = a.astring();
  if (name && a.end()) return name;
  c.send(tag + " BAD mailbox name expected\r\n");
  return std::nullopt;
}

// The mailbox of a name (INBOX made when missing); nullptr when it is no
// regular file below the home.
Mailbox* ImapSession::open_box(std::string_view name, bool create_inbox) {
  if (create_inbox && str_iequals(name, "INBOX")) {
    SafeDir root, mail;
    UniqueFd fd;
    if (SafeDir::open_root(home_, root).ok() && root.open_dir("mail", true, mail).ok())
      mail.open_file("inbox", O_RDWR | O_CREAT, fd, 0600);
  }
  return mailbox_lookup(path_of(name), home_);
}

// ---- commands: any state --------------------------------------------------------------

// STARTTLS before login while TLS can be had; LOGINDISABLED where a
// password may not be sent in the clear (RFC 2595).
void ImapSession::cmd_capability(Connection& c, const std::string& tag, Args&, bool) {
  std::string list = kCapabilities;
  if (auth_ == Auth::none && !c.secure() && tls_available()) list += " STARTTLS";
  if (!clear_login_allowed(c.peer().ip, c.secure())) list += " LOGINDISABLED";
  c.send("* CAPABILITY " + list + "\r\n" + tag + " OK CAPABILITY completed\r\n");
}

// The ready reply goes in the clear, then the handshake; the connection
// drops what the client sent behind the command. The client asks for the
// capabilities again once encrypted: none are sent unasked.
void ImapSession::cmd_starttls(Connection& c, const std::string& tag, Args& a, bool) {
  if (!a.end()) {
    c.send(tag + " BAD STARTTLS takes no arguments\r\n");
  } else if (c.secure()) {
    c.send(tag + " BAD TLS is already active\r\n");
  } else if (auth_ != Auth::none) {
    c.send(tag + " BAD Not in correct auth state\r\n");
  } else if (!tls_available()) {
    c.send(tag + " BAD TLS is not available on this server\r\n");
  } else {
    c.send(tag + " OK Begin TLS negotiation now\r\n");
    c.start_tls();
  }
}

void ImapSession::cmd_noop(Connection& c, const std::string& tag, Args&, bool) {
  sync(c, true);
  c.send(tag + " OK NOOP completed\r\n");
}

void ImapSession::cmd_idle(Connection& c, const std::string& tag, Args& a, bool) {
  if (!a.end()) {
    c.send(tag + " BAD IDLE takes no arguments\r\n");
    return;
  }
  idling_ = true;
  idle_tag_ = tag;
  c.send("+ idling\r\n");
  sync(c, true);
  // Waiting is what an idle client is for: it has a time-out of its own.
  c.set_idle_timeout(config.imap_idle_timeout);
}

// A line while idle: DONE ends the wait; anything else ends it as an error.
void ImapSession::idle_line(Connection& c, std::string_view line) {
  idling_ = false;
  c.set_idle_timeout(config.imap_sock_timeout);
  c.wake_after(std::chrono::milliseconds(0));
  if (!str_iequals(line, "DONE")) {
    c.send(idle_tag_ + " BAD IDLE ended without DONE\r\n");
    return;
  }
  sync(c, true);
  c.send(idle_tag_ + " OK IDLE terminated\r\n");
}

void ImapSession::cmd_namespace(Connection& c, const std::string& tag, Args& a, bool) {
  if (!a.end()) {
    c.send(tag + " BAD NAMESPACE takes no arguments\r\n");
    return;
  }
  c.send("* NAMESPACE ((\"\" \"/\")) NIL NIL\r\n" + tag + " OK NAMESPACE completed\r\n");
}

void ImapSession::cmd_check(Connection& c, const std::string& tag, Args&, bool) {
  mailbox_overview_flush(*box_);
  sync(c, true);
  c.send(tag + " OK CHECK completed\r\n");
}

void ImapSession::cmd_logout(Connection& c, const std::string& tag, Args&, bool) {
  deselect(c);
  c.send("* BYE Velmor Server Suite IMAP4rev1 server logging out\r\n" + tag + " OK LOGOUT completed\r\n");
  c.close_after_send();
}

void ImapSession::cmd_login(Connection& c, const std::string& tag, Args& a, bool) {
  if (auth_ != Auth::none) {
    c.send(tag + " BAD Not in correct auth state\r\n");
    return;
  }
  if (!clear_login_allowed(c.peer().ip, c.secure())) {
    // Neither looked up nor logged: the password crossed the network unencrypted.
    c.send(tag + " NO [PRIVACYREQUIRED] Use STARTTLS first: passwords are not accepted unencrypted"
                 " from outside the local network\r\n");
    return;
  }
  auto name = a.astring();
  auto password = a.space() ? a.astring() : std::nullopt;
  if (!name || !password || !a.end()) {
    c.send(tag + " BAD LOGIN needs a user name and a password\r\n");
    return;
  }
  const UserRecord* user = name->size() <= 64 ? user_find(*name) : nullptr;
  if (!user || password->size() > 256 || user_check_password(user->login, *password) != 0) {
    log_write("IMAP: Login failed for: " + printable(*name) + " from " + c.peer().text, logchan::main, kLogUnbuffered);
    ++failed_logins_;
    wait_ = Wait::login;
    wait_tag_ = tag;
    c.pause_input();  // nothing more is read until the late answer
    c.wake_after(kFailedLoginDelay);
    return;
  }
  auto group = user_group(user->login);
  if (!group_permits(group, "mail.imap.fetch")) {
    c.send(tag + " NO access to this server is forbidden\r\n");
    return;
  }
  if (user->home.empty()) {
    c.send(tag + " NO Bad LOGIN user name/password\r\n");
    return;
  }
  auth_ = Auth::authenticated;
  user_ = user->login;
  home_ = user->home;
  subscriptions_.emplace(home_);
  c.set_user(user->login);
  c.set_group(group);
  log_message("Login:", user->login, logfac::imap);
  c.send(tag + " OK LOGIN completed\r\n");
}

// ---- commands: mailboxes -------------------------------------------------------------

void ImapSession::select_common(Connection& c, const std::string& tag, Args& a, bool read_only) {
  auto name = one_name(c, tag, a);
  if (!name) return;
  deselect(c);
  if (!name_checked(c, tag, *name)) return;
  Mailbox* box = open_box(*name, true);
  if (!box) {
    c.send(tag + " NO Invalid mailbox - " + printable(*name) + "\r\n");
    return;
  }
  if (!mailbox_share(*box, c.id(), nullptr)) {
    c.send(tag + " NO [INUSE] mailbox in use by a POP3 session\r\n");
    return;
  }
  select_box(c, box, read_only);
  std::string out = strprintf("* %zu EXISTS\r\n* %zu RECENT\r\n", announced_, announced_recent_);
  out += "* FLAGS (\\Answered \\Flagged \\Deleted \\Seen \\Draft)\r\n";
  for (std::size_t i = 0; i < view_.size(); ++i) {
    if (!(view_[i].shown & msgflag::seen)) {
      strappendf(out, "* OK [UNSEEN %zu] first unseen message\r\n", i + 1);
      break;
    }
  }
  strappendf(out, "* OK [UIDVALIDITY %u] UIDs valid\r\n", box->uid_validity);
  strappendf(out, "* OK [UIDNEXT %u] Predicted next UID\r\n", box->next_uid);
  if (read_only) {
    out += "* OK [PERMANENTFLAGS ()] Read-only mailbox\r\n";
  } else {
    strappendf(out, "* OK [PERMANENTFLAGS %s] Limited\r\n", kPermanentFlags);
  }
  if (const auto& g = c.group(); g && g->size("mail.box.warn") && mailbox_size(*box) > g->size("mail.box.warn"))
    out += "* OK [ALERT] Mailbox full, please remove unnecessary messages\r\n";
  out += tag + (read_only ? " OK [READ-ONLY] EXAMINE completed\r\n" : " OK [READ-WRITE] SELECT completed\r\n");
  c.send(out);
}

void ImapSession::cmd_select(Connection& c, const std::string& tag, Args& a, bool) { select_common(c, tag, a, false); }
void ImapSession::cmd_examine(Connection& c, const std::string& tag, Args& a, bool) { select_common(c, tag, a, true); }

void ImapSession::cmd_create(Connection& c, const std::string& tag, Args& a, bool) {
  auto name = one_name(c, tag, a);
  if (!name) return;
  if (str_iequals(*name, "INBOX")) {
    c.send(tag + " NO can't create INBOX\r\n");
    return;
  }
  if (!name_checked(c, tag, *name, true)) return;
  bool folder = name->back() == '/';
  std::string rel = folder ? name->substr(0, name->size() - 1) : *name;
  std::string_view parent = path_dir(rel), leaf = path_leaf(rel);
  SafeDir root, dir;
  SafeResult r = SafeDir::open_root(home_, root);
  if (r.ok()) r = root.open_dir(parent, true, dir);
  if (r.ok() && dir.has(leaf)) {
    c.send(tag + " NO create failed: mailbox already exists\r\n");
    return;
  }
  if (r.ok() && folder) {
    if (::mkdirat(dir.fd(), std::string(leaf).c_str(), 0700) != 0) r = SafeResult{SafeStatus::failed, errno, rel};
  } else if (r.ok()) {
    UniqueFd fd;
    r = dir.open_file(leaf, O_RDWR | O_CREAT | O_EXCL, fd, 0600);
  }
  if (!r.ok()) {
    c.send(tag + (folder ? " NO create failed: can't create directory with that name\r\n"
                         : " NO create failed: can't create mailbox with that name\r\n"));
    return;
  }
  dir.sync();
  if (!folder) mailbox_lookup(path_of(*name), home_);  // indexed now: its identifiers' validity is chosen
  c.send(tag + " OK create completed\r\n");
}

void ImapSession::cmd_delete(Connection& c, const std::string& tag, Args& a, bool) {
  auto name = one_name(c, tag, a);
  if (!name) return;
  if (str_iequals(*name, "INBOX")) {
    c.send(tag + " NO can't delete INBOX\r\n");
    return;
  }
  if (!name_checked(c, tag, *name)) return;
  SafeDir root, dir;
  SafeResult r = SafeDir::open_root(home_, root);
  if (r.ok()) r = root.open_dir(path_dir(*name), false, dir);
  std::string leaf(path_leaf(*name));
  struct stat st {};
  if (!r.ok() || ::fstatat(dir.fd(), leaf.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 ||
      !(S_ISDIR(st.st_mode) || S_ISREG(st.st_mode))) {
    c.send(tag + " NO delete failed: no such mailbox\r\n");
    return;
  }
  if (!mailbox_forget(path_of(*name))) {
    c.send(tag + " NO [INUSE] delete failed: mailbox in use\r\n");
    return;
  }
  if (S_ISDIR(st.st_mode)) {
    SafeDir sub;
    if (dir.open_dir(leaf, false, sub).ok()) ::unlinkat(sub.fd(), "overview", AT_REMOVEDIR);  // empty: no boxes left
    if (::unlinkat(dir.fd(), leaf.c_str(), AT_REMOVEDIR) != 0) {
      c.send(tag + " NO delete failed: the folder is not empty\r\n");
      return;
    }
  } else {
    dir.remove(leaf);
    SafeDir overviews;
    if (dir.open_dir("overview", false, overviews).ok()) overviews.remove(leaf);
  }
  dir.sync();
  subscriptions_->carry(*name, std::nullopt);
  c.send(tag + " OK delete completed\r\n");
}

void ImapSession::cmd_rename(Connection& c, const std::string& tag, Args& a, bool) {
  auto from = a.astring();
  auto to = a.space() ? a.astring() : std::nullopt;
  if (!from || !to || !a.end()) {
    c.send(tag + " BAD RENAME needs two mailbox names\r\n");
    return;
  }
  if (str_iequals(*to, "INBOX")) {
    c.send(tag + " NO rename failed: can't rename to inbox\r\n");
    return;
  }
  if (!name_checked(c, tag, *from) || !name_checked(c, tag, *to)) return;
  std::string old_rel = rel_of(*from), new_rel = *to;
  if (old_rel == "mail" || new_rel.starts_with(old_rel + "/")) {
    c.send(tag + " NO rename failed: can't rename mailbox with that name\r\n");
    return;
  }
  SafeDir root, old_dir, new_dir;
  SafeResult r = SafeDir::open_root(home_, root);
  if (r.ok()) r = root.open_dir(path_dir(old_rel), false, old_dir);
  std::string old_leaf(path_leaf(old_rel)), new_leaf(path_leaf(new_rel));
  struct stat st {};
  if (!r.ok() || ::fstatat(old_dir.fd(), old_leaf.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 ||
      !(S_ISDIR(st.st_mode) || S_ISREG(st.st_mode))) {
    c.send(tag + " NO rename failed: no such mailbox\r\n");
    return;
  }
  r = root.open_dir(path_dir(new_rel), true, new_dir);
  if (r.ok() && new_dir.has(new_leaf)) {
    c.send(tag + " NO rename failed: mailbox already exists\r\n");
    return;
  }
  if (!r.ok()) {
    c.send(tag + " NO rename failed: can't rename mailbox with that name\r\n");
    return;
  }
  if (!mailbox_forget(path_of(*from))) {
    c.send(tag + " NO [INUSE] rename failed: mailbox in use\r\n");
    return;
  }
  if (sysio::renameat(old_dir.fd(), old_leaf.c_str(), new_dir.fd(), new_leaf.c_str()) != 0) {
    c.send(tag + " NO rename failed: can't rename mailbox with that name\r\n");
    return;
  }
  if (S_ISREG(st.st_mode)) {
    // The overview goes along, so the identifiers and flags do too.
    SafeDir old_ov, new_ov;
    if (old_dir.open_dir("overview", false, old_ov).ok() && new_dir.open_dir("overview", true, new_ov).ok() &&
        old_ov.has(old_leaf) && sysio::renameat(old_ov.fd(), old_leaf.c_str(), new_ov.fd(), new_leaf.c_str()) == 0) {
      old_ov.sync();
      new_ov.sync();
    }
  }
  old_dir.sync();
  new_dir.sync();
  if (!str_iequals(*from, "INBOX")) subscriptions_->carry(*from, *to);  // INBOX stays, empty
  c.send(tag + " OK rename completed\r\n");
}

void ImapSession::cmd_subscribe(Connection& c, const std::string& tag, Args& a, bool) {
  auto name = one_name(c, tag, a);
  if (!name) return;
  if (!name_checked(c, tag, *name)) return;
  std::string n = str_iequals(*name, "INBOX") ? "INBOX" : *name;
  if (int rc = subscriptions_->add(n)) {
    c.send(tag + (rc == E2BIG ? " NO [LIMIT] SUBSCRIBE failed: too many subscriptions\r\n"
                              : " NO SUBSCRIBE failed: " + error_text(rc) + "\r\n"));
    return;
  }
  c.send(tag + " OK SUBSCRIBE " + printable(n) + " completed\r\n");
}

void ImapSession::cmd_unsubscribe(Connection& c, const std::string& tag, Args& a, bool) {
  auto name = one_name(c, tag, a);
  if (!name) return;
  std::string n = str_iequals(*name, "INBOX") ? "INBOX" : *name;
  if (int rc = subscriptions_->remove(n)) {
    c.send(tag + (rc == ENOENT ? " NO Mailbox not in subscribe list\r\n"
                               : " NO UNSUBSCRIBE failed: " + error_text(rc) + "\r\n"));
    return;
  }
  c.send(tag + " OK UNSUBSCRIBE " + printable(n) + " completed\r\n");
}

// Every name SELECT takes that matches `pattern`, and the folders on the
// way: INBOX first, then the home's files and folders, without dot files,
// overview folders, expunge's "~" files, links and special files.
void ImapSession::list_names(std::string_view pattern, const std::function<void(const std::string&, bool)>& emit) {
  if (list_match("INBOX", pattern)) emit("INBOX", false);
  SafeDir root;
  if (!SafeDir::open_root(home_, root).ok()) return;
  std::size_t listed = 0;
  std::size_t pattern_depth = static_cast<std::size_t>(std::count(pattern.begin(), pattern.end(), '/'));
  bool deep = pattern.find('*') != std::string_view::npos;
  std::function<void(const SafeDir&, const std::string&, int)> walk = [&](const SafeDir& dir, const std::string& prefix,
                                                                          int depth) {
    int fd = ::dup(dir.fd());
    if (fd < 0) return;
    DIR* d = ::fdopendir(fd);
    if (!d) {
      ::close(fd);
      return;
    }
    std::vector<std::pair<std::string, bool>> entries;
    while (dirent* e = ::readdir(d)) {
      std::string n = e->d_name;
      if (n.empty() || n[0] == '.' || str_iequals(n, "overview") || n.back() == '~') continue;
      if (std::any_of(n.begin(), n.end(), [](char ch) { return static_cast<unsigned char>(ch) < ' ' || ch == 0x7f; }))
        continue;
      struct stat st {};
      if (::fstatat(dir.fd(), n.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
      if (S_ISDIR(st.st_mode) || S_ISREG(st.st_mode)) entries.emplace_back(n, S_ISDIR(st.st_mode));
    }
    ::closedir(d);
    std::sort(entries.begin(), entries.end());
    for (const auto& [n, is_dir] : entries) {
      if (listed >= kListEntries) return;
      std::string name = prefix + n;
      if (name == "mail/inbox") continue;  // INBOX
      if (list_match(name, pattern)) {
        emit(name, is_dir);
        ++listed;
      }
      std::size_t name_depth = static_cast<std::size_t>(std::count(name.begin(), name.end(), '/'));
      if (is_dir && depth < kListDepth && (deep || name_depth < pattern_depth)) {
        SafeDir sub;
        if (dir.open_dir(n, false, sub).ok()) walk(sub, name + "/", depth + 1);
      }
    }
  };
  walk(root, "", 0);
}

void ImapSession::cmd_list(Connection& c, const std::string& tag, Args& a, bool) {
  auto reference = a.astring();
  std::optional<std::string> pattern;
  if (reference && a.space()) {
    if (a.peek('"') || a.peek('{')) {
      pattern = a.string();
    } else {
      pattern = std::string(a.atom());
    }
  }
  if (!reference || !pattern || !a.end()) {
    c.send(tag + " BAD LIST needs a reference and a pattern\r\n");
    return;
  }
  if (pattern->empty()) {
    c.send("* LIST (\\Noselect) \"/\" \"\"\r\n" + tag + " OK LIST completed\r\n");
    return;
  }
  std::string full = *reference + *pattern;
  if (!imap_name_allowed(full, true) && !str_iequals(full, "INBOX")) {
    c.send(tag + " NO Invalid mailbox name\r\n");
    return;
  }
  std::string out;
  list_names(full, [&](const std::string& name, bool folder) {
    out += folder ? "* LIST (\\Noselect) \"/\" " : "* LIST (" + special_use(name) + ") \"/\" ";
    imap_append_string(out, name);
    out += "\r\n";
  });
  c.send(out + tag + " OK LIST completed\r\n");
}

void ImapSession::cmd_lsub(Connection& c, const std::string& tag, Args& a, bool) {
  auto reference = a.astring();
  std::optional<std::string> pattern;
  if (reference && a.space()) pattern = a.peek('"') || a.peek('{') ? a.string() : std::string(a.atom());
  if (!reference || !pattern || !a.end()) {
    c.send(tag + " BAD LSUB needs a reference and a pattern\r\n");
    return;
  }
  std::string out;
  for (const std::string& n : subscriptions_->names()) {
    if (!list_match(n, *reference + *pattern)) continue;
    out += "* LSUB () \"/\" ";
    imap_append_string(out, n);
    out += "\r\n";
  }
  c.send(out + tag + " OK LSUB completed\r\n");
}

void ImapSession::cmd_find(Connection& c, const std::string& tag, Args& a, bool) {
  std::string_view what = a.atom();
  auto pattern = a.space() ? a.astring() : std::nullopt;
  if (!str_iequals(what, "ALL.MAILBOXES") || !pattern || !a.end()) {
    c.send(tag + " BAD command unknown or arguments invalid\r\n");
    return;
  }
  if (!imap_name_allowed(*pattern, true) && !str_iequals(*pattern, "INBOX")) {
    c.send(tag + " NO Invalid mailbox name\r\n");
    return;
  }
  std::string out;
  list_names(*pattern, [&](const std::string& name, bool folder) {
    if (!folder) out += "* MAILBOX " + quoted(name) + "\r\n";
  });
  c.send(out + tag + " OK FIND ALL.MAILBOXES " + printable(path_leaf(*pattern)) + " completed\r\n");
}

void ImapSession::cmd_status(Connection& c, const std::string& tag, Args& a, bool) {
  auto name = a.astring();
  if (!name || !a.space() || !a.eat('(')) {
    c.send(tag + " BAD STATUS needs a mailbox and items\r\n");
    return;
  }
  std::vector<std::string> items;
  while (!a.eat(')')) {
    std::string_view item = a.atom();
    if (item.empty()) {
      c.send(tag + " BAD STATUS items expected\r\n");
      return;
    }
    items.emplace_back(item);
    a.space();
  }
  if (!name_checked(c, tag, *name)) return;
  Mailbox* box = open_box(*name, true);
  if (!box) {
    c.send(tag + " NO Invalid mailbox - " + printable(*name) + "\r\n");
    return;
  }
  std::string out = "* STATUS " + quoted(*name) + " (";
  for (const std::string& item : items) {
    if (out.back() != '(') out += ' ';
    if (str_iequals(item, "MESSAGES")) {
      strappendf(out, "MESSAGES %d", box->count);
    } else if (str_iequals(item, "RECENT")) {
      std::size_t recent =
          static_cast<std::size_t>(std::count_if(box->messages.begin(), box->messages.end(),
                                                 [box](const MessageRecord& m) { return m.uid > box->recent_uid; }));
      strappendf(out, "RECENT %zu", recent);
    } else if (str_iequals(item, "UIDNEXT")) {
      strappendf(out, "UIDNEXT %u", box->next_uid);
    } else if (str_iequals(item, "UIDVALIDITY")) {
      strappendf(out, "UIDVALIDITY %u", box->uid_validity);
    } else if (str_iequals(item, "UNSEEN")) {
      strappendf(out, "UNSEEN %d", box->unseen);
    } else {
      c.send(tag + " BAD unknown STATUS item\r\n");
      return;
    }
  }
  c.send(out + ")\r\n" + tag + " OK Status completed\r\n");
}

// ---- storing messages -------------------------------------------------------------

int ImapSession::store_messages(std::string_view name, std::size_t count,
                                const std::function<std::uint32_t(Writer&, std::uint32_t, std::size_t)>& write) {
  std::string rel = rel_of(name);
  SafeDir root;
  UniqueFd fd;
  SafeResult r = SafeDir::open_root(home_, root);
  if (r.ok()) r = root.open_file(rel, O_RDWR, fd);
  if (!r.ok()) return r.status == SafeStatus::missing ? ENOENT : r.error;
  Mailbox* box = mailbox_lookup(path_of(name), home_);
  if (!box) return ENOENT;
  if (box->appending) return EAGAIN;                    // delivery is writing a message into it
  if (int rc = mailbox_commit_staged(*box)) return rc;  // what delivery staged counts first
  for (std::size_t i = 0; i < count; ++i) {
    AppendSlot slot;
    UniqueFd mine(::dup(fd.get()));
    if (!mine) {
      mailbox_append_withdraw(*box, errno);
      return errno;
    }
    if (int rc = mailbox_append_begin(*box, std::move(mine), slot)) {
      mailbox_append_withdraw(*box, rc);
      return rc;
    }
    Writer w(mailbox_append_fd(*box), slot.offset);
    std::uint32_t flags = write(w, slot.uid, i);
    std::uint64_t end = w.end();
    int rc = w.finish();
    MessageRecord rec;
    if (!rc) {
      FileSource written(mailbox_append_fd(*box));
      LimitedSource limited(written, end);
      MessageParser parser(slot.offset);
      parser.step(limited, kNoMessage);
      std::uint64_t next = 0;
      rec = parser.take(next);
      if (rec.total_length != end - slot.offset || next != kNoMessage) rc = EIO;
    }
    if (rc) {
      mailbox_append_abandon(*box, slot);
      mailbox_append_withdraw(*box, rc);
      return rc;
    }
    rec.flags = (rec.flags & ~kKept) | (flags & kKept);
    mailbox_append_stage(*box, slot, std::move(rec), nullptr);
  }
  return mailbox_commit_staged(*box);
}

void ImapSession::cmd_append(Connection& c, const std::string& tag, Args&, bool) {
  // An APPEND reaches here only without its message literal.
  c.send(tag + " BAD APPEND needs a mailbox and a message\r\n");
}

// The APPEND's message is in; it is stored whole, or not at all.
void ImapSession::finish_append(Connection& c) {
  Args a(append_head_);
  std::string tag(a.atom());
  a.space();
  a.atom();  // APPEND
  a.space();
  auto name = a.astring();
  std::uint32_t flags = 0;
  std::optional<std::time_t> when;
  bool ok = name.has_value();
  while (ok && a.space() && !a.end()) {
    if (a.eat('(')) {
      while (ok && !a.eat(')')) {
        std::string_view f = a.atom();
        if (f.empty()) {
          ok = false;
          break;
        }
        std::uint32_t bit = imap_flag_bit(f);
        if (!bit && f.front() == '\\' && !str_iequals(f, "\\Recent")) ok = false;
        flags |= bit;
        a.space();
      }
    } else if (a.peek('"')) {
      auto d = a.string();
      when = d ? parse_date_time(*d) : std::nullopt;
      if (!when) ok = false;
    } else {
      ok = false;
    }
  }
  auto done = [&](const std::string& text) {
    c.send(text);
    reset_command();
  };
  if (!ok || !a.end() || !append_rest_.empty()) return done(tag + " BAD APPEND arguments invalid\r\n");
  if (!append_file_) return done(tag + " NO [SERVERBUG] the message could not be kept\r\n");
  if (!name_checked(c, tag, *name)) return reset_command();
  if (str_iequals(*name, "INBOX")) open_box(*name, true);
  FileSource raw(append_file_.get());
  if (raw.size() != append_size_) return done(tag + " NO [SERVERBUG] the message could not be kept\r\n");
  std::string separator =
      mailbox_separator("<" + user_ + "@" + text_of(config.server_name) + ">", when ? *when : std::time(nullptr));
  std::uint32_t stored_uid = 0;
  int rc = store_messages(*name, 1, [&](Writer& w, std::uint32_t uid, std::size_t) {
    stored_uid = uid;
    w.put(separator);
    write_appended(w, raw, flags, uid);
    return flags;
  });
  if (rc == EAGAIN) {
    // delivery is writing into the mailbox: a moment later
    wait_ = Wait::store;
    c.pause_input();
    c.wake_after(kStoreRetry);
    return;
  }
  if (rc == ENOENT) return done(tag + " NO [TRYCREATE] Mailbox does not exist\r\n");
  if (rc) return done(tag + " NO APPEND failed: " + error_text(rc) + "\r\n");
  sync(c, true);
  const Mailbox* target = mailbox_lookup(path_of(*name), home_);
  if (!target) return done(tag + " OK APPEND completed\r\n");
  done(strprintf("%s OK [APPENDUID %u %u] APPEND completed\r\n", tag.c_str(), target->uid_validity, stored_uid));
}

void ImapSession::cmd_move(Connection& c, const std::string& tag, Args& a, bool uid) {
  if (read_only_) {
    c.send(tag + " NO MOVE failed: mailbox is read-only\r\n");
    return;
  }
  moving_ = true;
  cmd_copy(c, tag, a, uid);
}

void ImapSession::cmd_copy(Connection& c, const std::string& tag, Args& a, bool uid) {
  const bool moving = std::exchange(moving_, false);
  std::string_view set = a.atom();
  auto name = a.space() ? a.astring() : std::nullopt;
  if (set.empty() || !name || !a.end()) {
    c.send(tag + (moving ? " BAD MOVE needs a message set and a mailbox\r\n"
                         : " BAD COPY needs a message set and a mailbox\r\n"));
    return;
  }
  auto targets = targets_of(c, tag, set, uid);
  if (!targets) return;
  if (!name_checked(c, tag, *name)) return;
  copy_target_ = *name;
  copy_targets_ = std::move(*targets);
  moving_ = moving;
  wait_tag_ = tag;
  finish_copy(c);
}

void ImapSession::finish_copy(Connection& c) {
  if (box_) sync(c, false);
  std::vector<std::size_t> live;
  for (std::size_t i : copy_targets_) {
    if (box_ && i < view_.size() && view_[i].rec) live.push_back(i);
  }
  // A message another session expunged meanwhile: nothing is copied.
  bool missing = live.size() != copy_targets_.size();
  int rc = 0;
  std::vector<std::uint32_t> from_uids, to_uids;
  if (!live.empty() && !missing) {
    if (str_iequals(copy_target_, "INBOX")) open_box(copy_target_, true);
    // The source is read through a reader of its own (the target may be the
    // same mailbox, growing as the copies are written).
    auto file = file_;
    FileSource in(file ? file->get() : -1);
    rc = !file ? EIO : store_messages(copy_target_, live.size(), [&](Writer& w, std::uint32_t uid, std::size_t k) {
      const Entry& e = view_[live[k]];
      std::uint32_t flags = e.rec->flags & kKept;
      from_uids.push_back(e.uid);
      to_uids.push_back(uid);
      write_copied(w, in, *e.rec, e.offset, flags, uid);
      return flags;
    });
  } else {
    SafeDir root;
    UniqueFd fd;
    if (!SafeDir::open_root(home_, root).ok() || !root.open_file(rel_of(copy_target_), O_RDONLY, fd).ok()) rc = ENOENT;
  }
  if (rc == EAGAIN) {
    wait_ = Wait::store;
    c.pause_input();
    c.wake_after(kStoreRetry);
    return;
  }
  std::string tag = wait_tag_;
  const bool moving = std::exchange(moving_, false);
  const char* verb = moving ? "MOVE" : "COPY";
  copy_targets_.clear();
  if (rc == ENOENT) {
    c.send(tag + " NO [TRYCREATE] Invalid mailbox: can't copy messages\r\n");
    return;
  }
  if (rc) {
    c.send(tag + " NO " + verb + " failed: " + error_text(rc) + "\r\n");
    return;
  }
  if (missing) {
    c.send(tag + " NO Some of the requested messages no longer exist\r\n");
    return;
  }
  std::string code;
  if (const Mailbox* target = to_uids.empty() ? nullptr : mailbox_lookup(path_of(copy_target_), home_))
    code = strprintf("[COPYUID %u %s %s] ", target->uid_validity, uid_text(from_uids).c_str(),
                     uid_text(to_uids).c_str());
  if (!moving) {
    c.send(tag + " OK " + code + "COPY completed\r\n");
    return;
  }
  // The copies are safely in: the originals go, and only they (other
  // deleted messages stay until an EXPUNGE).
  c.send("* OK " + code + "Moved\r\n");
  if (box_ && !from_uids.empty()) {
    std::vector<std::uint32_t> moved = from_uids;
    std::sort(moved.begin(), moved.end());
    auto is_moved = [&moved](const MessageRecord& m) { return std::binary_search(moved.begin(), moved.end(), m.uid); };
    for (MessageRecord& m : box_->messages) {
      if (is_moved(m) && !(m.flags & msgflag::deleted)) {
        m.flags |= msgflag::deleted;
        mailbox_flags_changed(*box_, m);
      }
    }
    rc = mailbox_expunge(*box_, is_moved);
  }
  sync(c, true);
  if (rc) {
    c.send(tag + " NO MOVE copied but could not remove the originals: " + error_text(rc) + "\r\n");
    return;
  }
  c.send(tag + " OK MOVE completed\r\n");
}

// ---- commands: the selected mailbox --------------------------------------------------

void ImapSession::cmd_close(Connection& c, const std::string& tag, Args&, bool) {
  if (!read_only_) mailbox_expunge(*box_);
  deselect(c);
  c.send(tag + " OK CLOSE completed\r\n");
}

void ImapSession::cmd_expunge(Connection& c, const std::string& tag, Args& a, bool uid) {
  // UID EXPUNGE removes only the deleted messages of its set.
  std::optional<std::vector<Range>> only;
  if (uid) {
    only = parse_set(a.atom(), view_.empty() ? 0xffffffffu : view_.back().uid);
    if (!only) {
      c.send(tag + " BAD Invalid message set\r\n");
      return;
    }
  }
  if (!a.end()) {
    c.send(tag + " BAD EXPUNGE arguments invalid\r\n");
    return;
  }
  if (read_only_) {
    c.send(tag + " NO Expunge failure: mailbox is read-only\r\n");
    return;
  }
  std::function<bool(const MessageRecord&)> filter;
  if (only) filter = [&only](const MessageRecord& m) { return in_set(*only, m.uid); };
  if (int rc = mailbox_expunge(*box_, filter)) {
    sync(c, true);
    c.send(tag + " NO Expunge failure: " + error_text(rc) + "\r\n");
    return;
  }
  sync(c, true);
  c.send(strprintf("* %zu EXISTS\r\n", view_.size()) + tag + " OK EXPUNGE completed\r\n");
}

void ImapSession::cmd_store(Connection& c, const std::string& tag, Args& a, bool uid) {
  std::string_view set = a.atom();
  std::string_view what = a.space() ? a.atom() : std::string_view{};
  int mode = 0;  // 0 replace, 1 add, -1 remove
  if (!what.empty() && (what.front() == '+' || what.front() == '-')) {
    mode = what.front() == '+' ? 1 : -1;
    what.remove_prefix(1);
  }
  bool silent = str_iequals(what, "FLAGS.SILENT");
  std::uint32_t flags = 0;
  bool ok = !set.empty() && (silent || str_iequals(what, "FLAGS")) && a.space();
  bool list = ok && a.eat('(');
  while (ok && !a.end() && !(list && a.peek(')'))) {
    std::string_view f = a.atom();
    if (f.empty()) {
      ok = false;
      break;
    }
    std::uint32_t bit = imap_flag_bit(f);
    if (!bit && f.front() == '\\' && !str_iequals(f, "\\Recent")) ok = false;  // keywords are not kept
    flags |= bit;
    a.space();
  }
  if (ok && list && !a.eat(')')) ok = false;
  if (!ok || !a.end()) {
    c.send(tag + " BAD STORE needs a message set, FLAGS and flags\r\n");
    return;
  }
  if (read_only_) {
    c.send(tag + " NO STORE failure: mailbox is read-only\r\n");
    return;
  }
  auto targets = targets_of(c, tag, set, uid);
  if (!targets) return;
  std::string out;
  bool missing = false;
  for (std::size_t i : *targets) {
    Entry& e = view_[i];
    if (!e.rec) {
      missing = true;
      continue;
    }
    MessageRecord& m = *e.rec;
    std::uint32_t before = m.flags & kKept;
    std::uint32_t after = mode == 0 ? flags : mode > 0 ? before | flags : before & ~flags;
    if (after != before) {
      bool seen_added = (after & msgflag::seen) && !(before & msgflag::seen);
      if (!(after & msgflag::seen) && (before & msgflag::seen)) ++box_->unseen;
      m.flags = (m.flags & ~kKept) | (after & ~msgflag::seen) | (before & after & msgflag::seen);
      mailbox_flags_changed(*box_, m);
      if (seen_added) mailbox_mark_seen(*box_, m, e.offset, user_);
    }
    e.shown = m.flags & kKept;
    if (!silent) {
      if (uid) {
        strappendf(out, "* %zu FETCH (UID %u FLAGS %s)\r\n", i + 1, e.uid, imap_flag_list(view_flags(e)).c_str());
      } else {
        strappendf(out, "* %zu FETCH (FLAGS %s)\r\n", i + 1, imap_flag_list(view_flags(e)).c_str());
      }
    }
  }
  c.send(out + tag + (missing ? " NO Some of the requested messages no longer exist\r\n" : " OK STORE completed\r\n"));
}

void ImapSession::cmd_fetch(Connection& c, const std::string& tag, Args& a, bool uid) {
  std::string_view set = a.atom();
  auto stream = std::make_unique<Stream>();
  if (set.empty() || !a.space() || imap_fetch_parse(a.rest(), stream->request) != FetchParse::ok) {
    c.send(tag + " BAD FETCH arguments invalid\r\n");
    return;
  }
  auto targets = targets_of(c, tag, set, uid);
  if (!targets) return;
  stream->tag = tag;
  stream->targets = std::move(*targets);
  stream->uid_mode = uid;
  stream_ = std::move(stream);
  stream_more(c);
}

// FETCH responses while the output has room; the rest as it drains.
void ImapSession::stream_more(Connection& c) {
  Stream& s = *stream_;
  if (stale_) remerge();  // positions hold; records and offsets are refreshed
  FetchOptions options{.uid_mode = s.uid_mode, .may_set_seen = !read_only_};
  ImapBuffer buf;
  while (s.next < s.targets.size() && !c.output_full() && !c.closed()) {
    std::size_t i = s.targets[s.next++];
    Entry& e = view_[i];
    if (!e.rec || !source_) {
      s.missing = true;
      continue;
    }
    FetchTarget target{*e.rec, e.offset, static_cast<std::uint32_t>(i + 1), view_flags(e)};
    buf.clear();
    FetchResult r = imap_fetch_render(s.request, target, *source_, options, buf);
    if (r.status != FetchStatus::done) {
      s.missing = true;
      continue;
    }
    ConnectionSink sink(c, file_);
    buf.replay(sink);
    if (r.seen_set) {
      mailbox_mark_seen(*box_, *e.rec, e.offset, user_);
      e.shown |= msgflag::seen;
    }
  }
  if (s.next < s.targets.size()) {
    gated(c);
    return;
  }
  c.send(s.tag + (s.missing ? " NO Some of the requested messages no longer exist\r\n" : " OK FETCH completed\r\n"));
  stream_.reset();
}

// ---- SEARCH -------------------------------------------------------------------------

bool ImapSession::search_keys(Args& a, std::vector<SearchKey>& out, int depth, SearchBuild& b) {
  for (;;) {
    SearchKey k;
    if (!search_key(a, k, depth, b)) return false;
    out.push_back(std::move(k));
    if (a.end() || a.peek(')')) return true;
    if (!a.space()) return false;
  }
}

bool ImapSession::search_key(Args& a, SearchKey& k, int depth, SearchBuild& b) {
  using K = SearchKey::Kind;
  if (depth > kSearchDepthLimit || ++b.keys > kSearchKeyLimit) {
    b.over_limit = true;
    return false;
  }
  if (a.eat('(')) {
    k.kind = K::group;
    if (!search_keys(a, k.sub, depth + 1, b)) return false;
    return a.eat(')');
  }
  std::string_view w = a.atom();
  if (w.empty()) return false;
  auto is = [&](std::string_view n) { return str_iequals(w, n); };
  auto arg = [&]() -> std::optional<std::string> { return a.space() ? a.astring() : std::nullopt; };
  auto day = [&](K kind) {
    auto d = arg();
    auto n = d ? parse_day(*d) : std::nullopt;
    if (!n) return false;
    k.kind = kind;
    k.number = *n;
    return true;
  };
  const struct {
    const char* name;
    std::uint32_t bit;
    bool on;
  } kFlagKeys[] = {{"ANSWERED", msgflag::answered, true}, {"UNANSWERED", msgflag::answered, false},
                   {"DELETED", msgflag::deleted, true},   {"UNDELETED", msgflag::deleted, false},
                   {"DRAFT", msgflag::draft, true},       {"UNDRAFT", msgflag::draft, false},
                   {"FLAGGED", msgflag::flagged, true},   {"UNFLAGGED", msgflag::flagged, false},
                   {"SEEN", msgflag::seen, true},         {"UNSEEN", msgflag::seen, false}};
  for (const auto& f : kFlagKeys) {
    if (is(f.name)) {
      k.kind = f.on ? K::flag_on : K::flag_off;
      k.flag = f.bit;
      return true;
    }
  }
  if (is("ALL")) return k.kind = K::all, true;
  if (is("RECENT")) return k.kind = K::recent, true;
  if (is("NEW")) return k.kind = K::new_, true;
  if (is("OLD")) return k.kind = K::old, true;
  if (is("KEYWORD") || is("UNKEYWORD")) {
    k.kind = is("KEYWORD") ? K::keyword : K::unkeyword;
    return arg().has_value();
  }
  if (is("BEFORE")) return day(K::before);
  if (is("ON")) return day(K::on);
  if (is("SINCE")) return day(K::since);
  if (is("SENTBEFORE")) return day(K::sent_before);
  if (is("SENTON")) return day(K::sent_on);
  if (is("SENTSINCE")) return day(K::sent_since);
  if (is("LARGER") || is("SMALLER")) {
    k.kind = is("LARGER") ? K::larger : K::smaller;
    auto n = arg();
    if (!n) return false;
    std::uint64_t v = 0;
    auto r = std::from_chars(n->data(), n->data() + n->size(), v);
    if (r.ec != std::errc() || r.ptr != n->data() + n->size()) return false;
    k.number = static_cast<std::int64_t>(std::min<std::uint64_t>(v, 1ULL << 62));
    return true;
  }
  auto text = [&](SearchAtom::Scope scope, std::optional<std::string> field) {
    auto v = field ? arg() : std::nullopt;
    if (!v) return false;
    k.kind = K::text;
    k.atom = b.query.atom({.scope = scope, .field = std::move(*field), .needle = std::move(*v)});
    return true;
  };
  if (is("FROM") || is("TO") || is("CC") || is("BCC") || is("SUBJECT"))
    return text(SearchAtom::Scope::header, std::string(w));
  if (is("HEADER")) return text(SearchAtom::Scope::header, arg());
  if (is("BODY")) return text(SearchAtom::Scope::body, std::string());
  if (is("TEXT")) return text(SearchAtom::Scope::text, std::string());
  if (is("NOT")) {
    k.kind = K::not_;
    k.sub.resize(1);
    return a.space() && search_key(a, k.sub[0], depth + 1, b);
  }
  if (is("OR")) {
    k.kind = K::or_;
    k.sub.resize(2);
    return a.space() && search_key(a, k.sub[0], depth + 1, b) && a.space() && search_key(a, k.sub[1], depth + 1, b);
  }
  if (is("UID")) {
    k.kind = K::uid;
    auto s = a.space() ? std::optional<std::string>(std::string(a.atom())) : std::nullopt;
    std::uint32_t highest = view_.empty() ? 0 : view_.back().uid;
    auto set = s ? parse_set(*s, highest) : std::nullopt;
    if (!set) return false;
    k.set = std::move(*set);
    return true;
  }
  auto set = parse_set(w, static_cast<std::uint32_t>(view_.size()));
  if (!set) return false;
  k.kind = K::set;
  k.set = std::move(*set);
  return true;
}

void ImapSession::cmd_search(Connection& c, const std::string& tag, Args& a, bool uid) {
  sync(c, false);
  if (a.peek('C') || a.peek('c')) {
    Args probe = a;
    if (str_iequals(probe.atom(), "CHARSET")) {
      a.atom();
      auto charset = a.space() ? a.astring() : std::nullopt;
      if (!charset || !a.space()) {
        c.send(tag + " BAD SEARCH arguments invalid\r\n");
        return;
      }
      if (!str_iequals(*charset, "US-ASCII") && !str_iequals(*charset, "UTF-8")) {
        c.send(tag + " NO [BADCHARSET (US-ASCII UTF-8)] unknown charset\r\n");
        return;
      }
    }
  }
  SearchBuild b;
  if (!search_keys(a, b.query.keys, 0, b) || !a.end()) {
    c.send(tag + (b.over_limit ? strprintf(" NO [LIMIT] SEARCH takes at most %zu keys, nested at most %d deep\r\n",
                                           kSearchKeyLimit, kSearchDepthLimit)
                               : std::string(" BAD SEARCH arguments invalid\r\n")));
    return;
  }
  search_ = std::make_unique<SearchJob>(SearchJob{tag, uid, SearchRun(std::move(b.query), view_.size())});
  if (search_step(c)) return;
  // More than a slice: the rest runs in the background, and the next
  // command waits for the answer.
  c.pause_input();
  search_work_ = BackgroundWork("IMAP search", [this] {
    if (!search_ || !conn_ || conn_->closed()) return false;
    if (!search_step(*conn_)) return true;
    conn_->resume_input();
    search_work_ = BackgroundWork();  // leaves the list (this slice runs on a copy)
    return false;
  });
}

// One slice of the SEARCH in hand; true (and the answer sent) once done.
bool ImapSession::search_step(Connection& c) {
  if (stale_) remerge();  // positions hold; records and offsets are refreshed
  auto at = [this](std::size_t i) -> std::optional<SearchMessage> {
    if (i >= view_.size() || !view_[i].rec) return std::nullopt;
    const Entry& e = view_[i];
    return SearchMessage{e.rec, e.offset, static_cast<std::uint32_t>(i + 1), e.uid, e.recent};
  };
  if (!search_->run.work(at, source_.get(), kSearchSlice)) return false;
  std::string out = "* SEARCH";
  for (std::size_t i : search_->run.matched())
    strappendf(out, " %u", search_->uid_mode ? view_[i].uid : static_cast<std::uint32_t>(i + 1));
  c.send(out + "\r\n" + search_->tag + " OK SEARCH completed\r\n");
  search_.reset();
  return true;
}

}  // namespace

bool imap_name_allowed(std::string_view name, bool pattern, bool folder) {
  if (name.empty() || name.size() > 1024 || name.front() == '/' || name.front() == '~') return false;
  if (folder && name.back() == '/') name.remove_suffix(1);
  if (name.empty()) return false;
  for (char ch : name) {
    if (static_cast<unsigned char>(ch) < ' ' || ch == 0x7f) return false;
    if (!pattern && (ch == '*' || ch == '%')) return false;
  }
  for (std::size_t from = 0;;) {
    std::size_t slash = name.find('/', from);
    std::string_view part = name.substr(from, slash == std::string_view::npos ? std::string_view::npos : slash - from);
    if (part.empty() || part.front() == '.' || str_iequals(part, "overview") || part.size() > 255) return false;
    if (slash == std::string_view::npos) return part.back() != '~';
    from = slash + 1;
  }
}

void imap_register() {
  service_register({
      .number = svc::imap,
      .name = "imap",
      .enabled = &config.imap_sock_enabled,
      .port = &config.imap_sock_port,
      .max = &config.imap_sock_max,
      .timeout = &config.imap_sock_timeout,
      .allow = &config.imap_allow,
      .block = &config.imap_block,
      .refusal = [] { return std::string("* BYE Connection refused\r\n"); },
      .make_session = [](Connection&, Admission) { return std::make_unique<ImapSession>(); },
      .paced_by_lines = false,  // a slow literal keeps the connection alive too
  });
}

}  // namespace velmor
