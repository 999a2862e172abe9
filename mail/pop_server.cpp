#include "mail/pop_server.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <optional>
#include <vector>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/sockets.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

namespace popstate {
constexpr int reply = 20;     // reply being sent, then wait
constexpr int waiting = 30;   // waiting for a command
constexpr int listing = 52;   // a listing being generated
constexpr int message = 50;   // a message being sent
constexpr int closing = 999;  // send, then close
}  // namespace popstate

constexpr std::size_t kNameLimit = 64;
constexpr std::size_t kPasswordLimit = 64;
// A refused password is answered this much later (other clients are served
// meanwhile), and the connection ends after this many refusals, so guessing
// is slow.
constexpr int kFailedLoginDelayMs = 1000;
constexpr int kFailedLoginLimit = 3;
// Commands are not run while the output buffer has less room than the
// longest reply, so pipelined commands can never overrun it.
constexpr std::size_t kReplyRoom = 600;
// Per write call at most this many buffer fills, so one big download does
// not keep other connections waiting.
constexpr int kFillsPerCall = 64;

struct Range {
  std::uint64_t offset = 0, length = 0;
};

struct PopSession : SessionData {
  char phase = 'd';  // 'd' authorization, 'e' user name given, 'f' transaction
  std::string user;
  bool user_ok = false;
  int failed_logins = 0;
  bool answer_pending = false;  // a refused login's reply waits for its timer
  Mailbox* box = nullptr;
  UniqueFd file;
  // This session's deletions, by message number - 1; nobody else sees them
  // until QUIT applies them.
  std::vector<char> deleted;
  std::vector<MessageRecord*> index;
  std::vector<std::uint64_t> offsets;
  bool last_cr = false;  // the previous line ended with CR (its LF may follow)
  // A line longer than the input buffer: refused once, then skipped to its end.
  bool skip_line = false;
  bool overlong_pending = false;

  // What is being streamed beyond the reply.
  enum class Listing { none, list, uidl } listing = Listing::none;
  std::size_t list_next = 0;
  std::vector<Range> ranges;
  std::size_t range_at = 0;
  std::string trailer;
  bool streaming() const { return listing != Listing::none || range_at < ranges.size() || !trailer.empty(); }
};

PopSession& session(SocketRecord& r) { return r.session_as<PopSession>(); }

void reply(SocketRecord& r, std::string_view text) { r.write_buf.append(text); }

std::string short_text(const std::string& value) { return value.substr(0, 200); }

// The message list as the session sees it: numbered from 1 in mailbox
// order; messages delivered meanwhile join at the end.
void sync_index(PopSession& s) {
  if (!s.box || !s.file) {
    s.index.clear();
    s.offsets.clear();
    return;
  }
  if (s.index.size() == s.box->messages.size()) return;
  s.index.clear();
  s.offsets.clear();
  std::uint64_t off = 0;
  for (auto& m : s.box->messages) {
    s.index.push_back(&m);
    s.offsets.push_back(off);
    off += m.total_length;
  }
  s.deleted.resize(s.index.size(), 0);
}

bool visible(const PopSession& s, std::size_t i) {
  return !s.deleted[i] && !(s.index[i]->flags & msgflag::deleted);
}

// Message number n (1-based) when it exists and is not deleted.
std::optional<std::size_t> message_number(const PopSession& s, std::string_view arg, bool include_deleted = false) {
  arg = trim_blanks(arg);
  std::size_t n = 0;
  auto r = std::from_chars(arg.data(), arg.data() + arg.size(), n);
  if (r.ec != std::errc() || n == 0 || n > s.index.size()) return std::nullopt;
  if (!include_deleted && !visible(s, n - 1)) return std::nullopt;
  return n - 1;
}

void drop_mailbox(SocketRecord& r, PopSession& s) {
  if (s.box) mailbox_release(*s.box, r.id);
  s.box = nullptr;
  s.file.close();
  s.deleted.clear();
  s.index.clear();
  s.offsets.clear();
}

void totals(const PopSession& s, std::size_t& count, std::uint64_t& octets) {
  count = 0;
  octets = 0;
  for (std::size_t i = 0; i < s.index.size(); ++i) {
    if (!visible(s, i)) continue;
    ++count;
    octets += s.index[i]->length;
  }
}

void pass(SocketRecord& r, PopSession& s, std::string_view password, bool& discard) {
  if (s.phase != 'e') {
    reply(r, "-ERR Invalid command; valid commands:  USER,  QUIT\r\n");
    s.phase = 'd';
    discard = true;
    return;
  }
  const UserRecord* user = s.user_ok ? user_find(s.user) : nullptr;
  if (!user || password.size() > kPasswordLimit || user_check_password(user->login, password) != 0) {
    // Logged whatever store.state says; the password never is.
    std::string name = s.user.substr(0, kNameLimit);
    for (char& c : name) {
      if (static_cast<unsigned char>(c) < ' ' || c == 0x7f) c = '?';
    }
    log_write("POP: Login failed for: " + name + " from " + r.peer_addr, logchan::main, kLogUnbuffered);
    s.phase = 'd';
    ++s.failed_logins;
    s.answer_pending = true;
    socket_timer(r, kFailedLoginDelayMs);
    return;
  }
  auto group = user_group(user->login);
  if (!group_permits(group, "mail.pop.fetch")) {
    reply(r, "-ERR access to this server forbidden\r\n");
    s.phase = 'd';
    return;
  }
  s.phase = 'f';
  r.user_name = user->login;
  r.group_opts = group;
  Mailbox* box = user->home.empty() ? nullptr : mailbox_lookup(path_join(user->home, "mail/inbox"));
  if (!box) {
    reply(r, "+OK 0 messages waiting\r\n");
    return;
  }
  if (!mailbox_take(*box, r.id)) {
    s.phase = 'd';
    reply(r, "-ERR mailbox already in use: another POP or IMAP session is currently active\r\n");
    discard = true;
    return;
  }
  s.box = box;
  s.file = mailbox_open(*box);
  if (!s.file) {
    drop_mailbox(r, s);
    reply(r, strprintf("+OK 0 messages waiting for %s (no mbox)\r\n", user->login.c_str()));
    return;
  }
  sync_index(s);
  std::size_t count;
  std::uint64_t octets;
  totals(s, count, octets);
  log_message("Login:", user->login, logfac::pop);
  reply(r, strprintf("+OK %zu messages waiting for %s\r\n", count, user->login.c_str()));
}

// The last bytes of message i, to see whether it carries its terminator.
std::string message_tail(PopSession& s, std::size_t i) {
  const MessageRecord& m = *s.index[i];
  std::uint64_t end = s.offsets[i] + m.total_length;
  std::size_t want = static_cast<std::size_t>(std::min<std::uint64_t>(5, m.length));
  std::string tail(want, '\0');
  ssize_t n = ::pread(s.file.get(), tail.data(), want, static_cast<off_t>(end - want));
  if (n != static_cast<ssize_t>(want)) return {};
  return tail;
}

bool message_readable(PopSession& s, std::size_t i) {
  struct stat st {};
  return ::fstat(s.file.get(), &st) == 0 &&
         static_cast<std::uint64_t>(st.st_size) >= s.offsets[i] + s.index[i]->total_length;
}

// The stored message ends with its "." line; one that lost it (a damaged
// file) gets one, so the client never waits for an end that never comes.
std::string missing_terminator(const std::string& tail) {
  if (tail.size() == 5 && (tail == "\r\n.\r\n" || tail.substr(2) == "\n.\n")) return {};
  if (!tail.empty() && tail.back() == '\n') return ".\r\n";
  return "\r\n.\r\n";
}

void retr(SocketRecord& r, PopSession& s, std::string_view arg) {
  auto i = message_number(s, arg);
  if (!i) {
    reply(r, "-ERR message does not exist or has been deleted\r\n");
    return;
  }
  const MessageRecord& m = *s.index[*i];
  std::string tail = message_tail(s, *i);
  if (!message_readable(s, *i) || (tail.empty() && m.length)) {
    reply(r, "-ERR bad message in mailbox (TOP)\r\n");
    return;
  }
  reply(r, strprintf("+OK %llu octets\r\n", static_cast<unsigned long long>(m.length)));
  s.ranges = {{s.offsets[*i] + (m.total_length - m.length), m.length}};
  s.range_at = 0;
  s.trailer = missing_terminator(tail);
  r.state = popstate::message;
  // A download is not a reading: no seen mark, and no read receipt.
}

bool starts_status(std::string_view line) {
  return str_istarts_with(line, "Status:") || str_istarts_with(line, "X-Status:");
}

void top(SocketRecord& r, PopSession& s, std::string_view args) {
  if (s.index.empty()) {
    reply(r, "-ERR no messages in mailbox (TOP)\r\n");
    return;
  }
  args = trim_blanks(args);
  std::size_t blank = args.find_first_of(" \t");
  auto i = message_number(s, args.substr(0, blank));
  if (!i) {
    reply(r, "-ERR no such message\r\n");
    return;
  }
  std::string_view count_text =
      blank == std::string_view::npos ? std::string_view{} : trim_blanks(args.substr(blank));
  std::uint64_t lines = 0;
  auto parsed = std::from_chars(count_text.data(), count_text.data() + count_text.size(), lines);
  if (count_text.empty() || parsed.ec != std::errc()) {
    reply(r, "-ERR syntax is `TOP <msg no> <lines>', eg. TOP 1 7\r\n");
    return;
  }
  if (!message_readable(s, *i)) {
    reply(r, "-ERR bad message in mailbox (TOP)\r\n");
    return;
  }
  const MessageRecord& m = *s.index[*i];
  std::uint64_t start = s.offsets[*i] + (m.total_length - m.length);
  std::uint64_t end = s.offsets[*i] + m.total_length;
  // The header without the mailbox's own status lines, its empty line, then
  // the first `lines` lines of the body.
  FileSource in(s.file.get());
  std::vector<Range> ranges;
  auto add = [&](std::uint64_t off, std::uint64_t len) {
    if (!ranges.empty() && ranges.back().offset + ranges.back().length == off) {
      ranges.back().length += len;
    } else {
      ranges.push_back({off, len});
    }
  };
  std::uint64_t pos = start;
  bool in_header = true, dropping = false;
  std::uint64_t body_lines = 0;
  while (pos < end) {
    Line line = read_line(in, pos, 64);
    if (line.length == 0) break;
    std::uint64_t len = std::min(line.length, end - pos);
    if (in_header) {
      if (line_body(line.text).empty() || is_terminator_line(line.text)) {
        in_header = false;
        if (is_terminator_line(line.text)) {
          add(pos, len);
          pos += len;
          break;
        }
        add(pos, len);
      } else {
        bool folded = line.text.front() == ' ' || line.text.front() == '\t';
        if (!folded) dropping = starts_status(line.text);
        if (!dropping) add(pos, len);
      }
    } else {
      if (body_lines == lines) break;
      ++body_lines;
      add(pos, len);
    }
    pos += len;
  }
  std::uint64_t total = 0;
  for (const Range& rg : ranges) total += rg.length;
  reply(r, strprintf("+OK %llu octets\r\n", static_cast<unsigned long long>(total)));
  s.ranges = std::move(ranges);
  s.range_at = 0;
  s.trailer = pos < end ? ".\r\n" : missing_terminator(message_tail(s, *i));
  r.state = popstate::message;
}

void quit(SocketRecord& r, PopSession& s) {
  r.state = popstate::closing;
  std::size_t left = 0;
  bool failed = false;
  if (s.box) {
    sync_index(s);
    s.file.close();
    std::vector<MessageRecord*> marked;
    for (std::size_t i = 0; i < s.index.size(); ++i) {
      if (s.deleted[i] && !(s.index[i]->flags & msgflag::deleted)) {
        s.index[i]->flags |= msgflag::deleted;
        marked.push_back(s.index[i]);
      }
    }
    if (!marked.empty() && mailbox_expunge(*s.box) != 0) {
      for (MessageRecord* m : marked) m->flags &= ~msgflag::deleted;
      failed = true;
    }
    s.index.clear();
    left = static_cast<std::size_t>(s.box->count);
    drop_mailbox(r, s);
  }
  if (failed) {
    reply(r, "-ERR mailbox could not be updated, no messages were deleted\r\n");
    return;
  }
  reply(r, strprintf("+OK %s Velmor POP3 server (%s) shutdown (%zu messages left)\r\n",
                     short_text(text_of(config.server_name)).c_str(), kVersion, left));
}

// Runs one command line. `discard` is set when the rest of the input is to
// be thrown away.
void command(SocketRecord& r, PopSession& s, std::string_view line, bool& discard) {
  std::size_t verb_end = line.find_first_of(" \t");
  std::string_view verb = line.substr(0, verb_end);
  std::string_view arg = verb_end == std::string_view::npos ? std::string_view{} : line.substr(verb_end + 1);
  if (verb.size() >= 10) {
    reply(r, "-ERR Bad command - too long\r\n");
    discard = true;
    return;
  }
  if (verb.empty()) {
    reply(r, "-ERR Bad command\r\n");
    return;
  }
  auto is = [&](std::string_view name) { return str_iequals(verb, name); };
  if (s.phase == 'f' && (is("USER") || is("PASS"))) {
    // One login per session: the mailbox taken stays the only one.
    reply(r, "-ERR Invalid command; valid commands:  STAT, LIST, UIDL, TOP, RETR, DELE, RSET, NOOP, QUIT\r\n");
    discard = true;
    return;
  }
  if (is("USER")) {
    arg = trim_blanks(arg);
    s.user_ok = !arg.empty() && arg.size() <= kNameLimit;
    s.user.assign(arg.substr(0, kNameLimit));
    s.phase = 'e';
    reply(r, "+OK please send PASS command\r\n");
    return;
  }
  if (is("PASS")) {
    pass(r, s, arg, discard);
    return;
  }
  if (is("QUIT")) {
    quit(r, s);
    return;
  }
  if (is("NOOP")) {
    reply(r, "+OK\r\n");
    return;
  }
  bool mailbox_command =
      is("STAT") || is("RSET") || is("LIST") || is("UIDL") || is("TOP") || is("RETR") || is("DELE");
  if (!mailbox_command) {
    std::string shown(verb);
    for (char& c : shown) {
      if (static_cast<unsigned char>(c) < ' ' || static_cast<unsigned char>(c) > '~') c = '?';
    }
    reply(r, strprintf("-ERR Unknown command: %s\r\n", shown.c_str()));
    return;
  }
  if (s.phase != 'f') {
    reply(r, s.phase == 'e' ? "-ERR Invalid command; valid commands:  USER, PASS, QUIT\r\n"
                            : "-ERR Invalid command; valid commands:  USER,  QUIT\r\n");
    discard = true;
    return;
  }
  sync_index(s);
  std::size_t count;
  std::uint64_t octets;
  if (is("STAT") || is("RSET")) {
    if (is("RSET")) std::fill(s.deleted.begin(), s.deleted.end(), 0);
    totals(s, count, octets);
    reply(r, strprintf("+OK %zu %llu\r\n", count, static_cast<unsigned long long>(octets)));
  } else if (is("LIST") || is("UIDL")) {
    bool list = is("LIST");
    if (!trim_blanks(arg).empty()) {
      auto i = message_number(s, arg);
      if (!i) {
        reply(r, "-ERR no such message\r\n");
      } else {
        reply(r, strprintf("+OK %zu %llu\r\n", *i + 1,
                           static_cast<unsigned long long>(list ? s.index[*i]->length : s.index[*i]->uid)));
      }
      return;
    }
    if (!list && !s.box) {
      reply(r, "-ERR no messages in mailbox (UIDL)\r\n");
      return;
    }
    if (list) {
      totals(s, count, octets);
      reply(r, strprintf("+OK %zu messages (%llu octets)\r\n", count, static_cast<unsigned long long>(octets)));
    } else {
      reply(r, "+OK\r\n");
    }
    s.listing = list ? PopSession::Listing::list : PopSession::Listing::uidl;
    s.list_next = 0;
    r.state = popstate::listing;
  } else if (is("TOP")) {
    top(r, s, arg);
  } else if (is("RETR")) {
    retr(r, s, arg);
  } else if (is("DELE")) {
    auto i = message_number(s, arg, true);
    if (!i || (s.index[*i]->flags & msgflag::deleted)) {
      reply(r, "-ERR no such message\r\n");
    } else {
      s.deleted[*i] = 1;
      reply(r, strprintf("+OK message %zu deleted\r\n", *i + 1));
    }
  }
}

// The input buffer is full without a line end: the line is refused (once)
// and the rest of it skipped as it arrives.
void overlong(PopSession& s, SocketRecord& r) {
  r.read_buf.clear();
  s.last_cr = false;
  if (!s.skip_line) s.overlong_pending = true;
  s.skip_line = true;
}

// Runs the complete command lines in the input until one starts a stream
// or the output buffer could not take another reply.
void process(SocketRecord& r, PopSession& s) {
  while (!s.streaming() && !s.answer_pending && r.state != popstate::closing &&
         r.write_buf.room() >= kReplyRoom) {
    std::string_view in = r.read_buf.view();
    if (s.last_cr && !in.empty()) {
      s.last_cr = false;
      if (in.front() == '\n') {
        r.read_buf.consume(1);  // moves the data: view it again
        in = r.read_buf.view();
      }
    }
    if (s.overlong_pending) {
      s.overlong_pending = false;
      reply(r, "-ERR Bad command - too long\r\n");
      continue;
    }
    std::size_t eol = in.find_first_of("\r\n");
    if (s.skip_line) {  // the rest of an overlong line
      if (eol == std::string_view::npos) {
        r.read_buf.clear();
        return;
      }
      s.skip_line = false;
      r.read_buf.consume(eol + 1);
      s.last_cr = in[eol] == '\r';
      continue;
    }
    if (eol == std::string_view::npos) {
      if (r.read_buf.room() != 0) return;
      overlong(s, r);
      continue;
    }
    std::size_t used = eol + 1;
    if (in[eol] == '\r') {
      if (used < in.size() && in[used] == '\n') {
        ++used;
      } else {
        s.last_cr = true;
      }
    }
    r.state = popstate::reply;
    bool discard = false;
    command(r, s, in.substr(0, eol), discard);
    if (discard) {
      r.read_buf.clear();
      s.last_cr = false;
    } else {
      r.read_buf.consume(used);
    }
  }
}

// Appends as much of the current stream to the output buffer as fits.
void fill(SocketRecord& r, PopSession& s) {
  while (r.write_buf.room() > 0) {
    if (s.listing != PopSession::Listing::none) {
      while (s.list_next < s.index.size() && r.write_buf.room() >= 48) {
        std::size_t i = s.list_next++;
        if (!visible(s, i)) continue;
        const MessageRecord& m = *s.index[i];
        char line[48];
        int n = std::snprintf(line, sizeof line, "%zu %llu\r\n", i + 1,
                              static_cast<unsigned long long>(s.listing == PopSession::Listing::list ? m.length : m.uid));
        r.write_buf.append(std::string_view(line, static_cast<std::size_t>(n)));
      }
      if (s.list_next < s.index.size() || r.write_buf.room() < 3) return;
      r.write_buf.append(".\r\n");
      s.listing = PopSession::Listing::none;
      continue;
    }
    if (s.range_at < s.ranges.size()) {
      Range& rg = s.ranges[s.range_at];
      std::size_t want = static_cast<std::size_t>(std::min<std::uint64_t>(r.write_buf.room(), rg.length));
      ssize_t n = ::pread(s.file.get(), r.write_buf.tail(), want, static_cast<off_t>(rg.offset));
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        // The client cannot tell a cut message from a whole one unless the
        // connection ends here.
        s.ranges.clear();
        s.range_at = 0;
        s.trailer.clear();
        if (r.write_buf.room() >= 64) r.write_buf.append("-ERR Internal error occured whilst sending message");
        r.state = popstate::closing;
        return;
      }
      r.write_buf.commit(static_cast<std::size_t>(n));
      rg.offset += static_cast<std::uint64_t>(n);
      rg.length -= static_cast<std::uint64_t>(n);
      if (rg.length == 0) ++s.range_at;
      continue;
    }
    if (!s.trailer.empty()) {
      if (r.write_buf.room() < s.trailer.size()) return;
      r.write_buf.append(s.trailer);
      s.trailer.clear();
    }
    s.ranges.clear();
    s.range_at = 0;
    return;
  }
}

// Sends what is pending, keeps streams flowing and runs pipelined commands.
// Non-zero when the connection is to be closed.
int pump(SocketRecord& r) {
  PopSession& s = session(r);
  for (int round = 0; round < kFillsPerCall; ++round) {
    fill(r, s);
    if (!r.write_buf.empty()) {
      if (socket_send(r) < 0) return 1;
      if (!r.write_buf.empty()) {
        r.want_write = true;
        return 0;  // the socket is full; the dispatcher calls again when writable
      }
    }
    if (s.streaming()) continue;
    if (r.state == popstate::closing) return 1;
    r.state = popstate::waiting;
    process(r, s);
    if (r.write_buf.empty() && !s.streaming()) {
      r.want_write = false;
      return r.state == popstate::closing ? 1 : 0;
    }
  }
  r.want_write = true;
  return 0;
}

}  // namespace

int pop_accept(SocketRecord& r) {
  if (peer_rule(r.peer_ip, config.pop_allow, config.pop_block) == PeerRule::blocked) {
    socket_send(r, "-ERR Connection refused\r\n");
    return 1;
  }
  r.session = std::make_unique<PopSession>();
  r.state = popstate::reply;
  reply(r, strprintf("+OK %s Velmor Server Suite POP3 Server (v%s %s) ready at %s - Report problems to %s\r\n",
                     short_text(text_of(config.server_name)).c_str(), kVersion, kPlatform,
                     time_text(server_now ? server_now : std::time(nullptr)).c_str(),
                     short_text(text_of(config.admin_email)).c_str()));
  return pump(r);
}

int pop_read(SocketRecord& r, long) {
  if (!r.session) return 1;
  PopSession& s = session(r);
  if (s.streaming() || !r.write_buf.empty() || s.answer_pending) {
    // Commands wait until the current reply is out; the input stays.
    if (r.read_buf.room() == 0 && r.read_buf.view().find_first_of("\r\n") == std::string_view::npos) {
      overlong(s, r);
    }
    return 0;
  }
  r.state = popstate::waiting;
  process(r, s);
  return pump(r);
}

int pop_write(SocketRecord& r) {
  if (!r.session) return 1;
  return pump(r);
}

int pop_timer(SocketRecord& r) {
  if (!r.session) return 1;
  PopSession& s = session(r);
  if (!s.answer_pending) return 0;
  s.answer_pending = false;
  reply(r, "-ERR Invalid username or password, please try again\r\n");
  if (s.failed_logins >= kFailedLoginLimit) r.state = popstate::closing;
  return pump(r);
}

void pop_release(SocketRecord& r) {
  if (!r.session) return;
  PopSession& s = session(r);
  // A connection that ends without QUIT deletes nothing.
  drop_mailbox(r, s);
}

void pop_server_init() {
  ServiceHandlers h;
  h.accept = pop_accept;
  h.read = pop_read;
  h.write = pop_write;
  h.timer = pop_timer;
  h.release = pop_release;
  register_service(svc::pop, std::move(h));
}

}  // namespace velmor
