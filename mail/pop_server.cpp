// The POP3 server. Each connection is one PopSession: it answers commands
// line by line, streams messages straight from the mailbox file as file
// ranges of the connection's output, and produces long listings part by
// part as the output drains.
#include "mail/pop_server.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <memory>
#include <optional>
#include <vector>

#include "core/config.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/tls.h"
#include "core/util.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"
#include "mail/queue_text.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

constexpr std::size_t kNameLimit = 64;
constexpr std::size_t kPasswordLimit = 64;
// A refused password is answered this much later (other clients are served
// meanwhile), and the connection ends after this many refusals, so guessing
// is slow.
constexpr std::chrono::milliseconds kFailedLoginDelay{1000};
constexpr int kFailedLoginLimit = 3;
constexpr std::size_t kListingLines = 256;  // listing lines queued at a time

const char* const kBadLogin = "-ERR Invalid username or password, please try again\r\n";
const char* const kLoginNeedsTls =
    "-ERR [AUTH] Use STLS first: passwords are not accepted unencrypted from outside the local network\r\n";

std::string short_text(const std::string& value) { return value.substr(0, 200); }

bool starts_status(std::string_view line) {
  return str_istarts_with(line, "Status:") || str_istarts_with(line, "X-Status:");
}

class PopSession final : public Session {
 public:
  void on_open(Connection& c) override;
  void on_input(Connection& c) override;
  void on_drained(Connection& c) override { list_more(c); }
  void on_timer(Connection& c) override;
  void on_close(Connection& c, CloseReason) override { drop_mailbox(c); }

 private:
  enum class State {
    authorization,  // no user yet, or a login failed
    user_given,     // USER seen, PASS expected
    transaction,    // logged in
  };
  enum class Listing { none, list, uidl };
  struct Range {
    std::uint64_t offset = 0, length = 0;
  };
  // A message as it was when the session took the mailbox. The session
  // keeps that file open, so its numbers, offsets and bytes stay valid
  // whatever other sessions expunge meanwhile.
  struct Entry {
    std::uint64_t offset = 0;        // of its separator line
    std::uint64_t total_length = 0;  // with the separator line
    std::uint64_t length = 0;        // without it
    std::uint32_t uid = 0;
  };

  // Runs one line; false when the rest of the input is to be thrown away.
  bool command(Connection& c, std::string_view line);
  bool pass(Connection& c, std::string_view password);
  void stls(Connection& c);
  // STLS may be offered and used now.
  bool tls_offered(const Connection& c) const {
    return state_ != State::transaction && !c.secure() && tls_available();
  }
  void mailbox_command(Connection& c, std::string_view verb, std::string_view arg);
  void retr(Connection& c, std::string_view arg);
  void top(Connection& c, std::string_view args);
  void quit(Connection& c);
  void list_more(Connection& c);
  void send_ranges(Connection& c, const std::vector<Range>& ranges, std::uint64_t end);

  void take_snapshot();
  std::optional<std::size_t> message_number(std::string_view arg, bool include_deleted = false) const;
  void totals(std::size_t& count, std::uint64_t& octets) const;
  std::uint64_t text_start(std::size_t i) const { return index_[i].offset + index_[i].total_length - index_[i].length; }
  std::optional<std::uint64_t> text_end(std::size_t i) const;
  void drop_mailbox(Connection& c);

  State state_ = State::authorization;
  std::string user_;
  bool user_ok_ = false;
  int failed_logins_ = 0;
  Mailbox* box_ = nullptr;
  // The mailbox file, shared with the file ranges still being sent.
  std::shared_ptr<const UniqueFd> file_;
  // This session's deletions, by message number - 1; nobody else sees them
  // until QUIT applies them.
  std::vector<char> deleted_;
  std::vector<Entry> index_;
  Listing listing_ = Listing::none;
  std::size_t list_next_ = 0;
};

void PopSession::on_open(Connection& c) {
  c.send(strprintf("+OK %s Velmor Server Suite POP3 Server (v%s %s) ready at %s - Report problems to %s\r\n",
                   short_text(text_of(config.server_name)).c_str(), kVersion, kPlatform,
                   time_text(server_now ? server_now : std::time(nullptr)).c_str(),
                   short_text(admin_address()).c_str()));
}

void PopSession::on_input(Connection& c) {
  std::string_view line;
  while (listing_ == Listing::none && !c.input_paused()) {
    LineResult r = c.read_line(line);
    if (r == LineResult::need_more) return;
    if (r == LineResult::overlong) {
      c.send("-ERR Bad command - too long\r\n");
      continue;
    }
    if (!command(c, line)) c.consume(c.buffered().size());
  }
}

// The answer to a refused password, a second late.
void PopSession::on_timer(Connection& c) {
  c.send(kBadLogin);
  if (failed_logins_ >= kFailedLoginLimit) {
    c.close_after_send();
    return;
  }
  c.resume_input();
}

// The messages present now, numbered from 1 in mailbox order, are the
// session's for good (RFC 1939): mail delivered later waits for the next
// session, and what IMAP sessions expunge meanwhile is still read from the
// file this session holds. Messages an IMAP client has marked deleted are
// left out.
void PopSession::take_snapshot() {
  index_.clear();
  std::uint64_t off = 0;
  for (const MessageRecord& m : box_->messages) {
    if (!(m.flags & msgflag::deleted)) index_.push_back({off, m.total_length, m.length, m.uid});
    off += m.total_length;
  }
  deleted_.assign(index_.size(), 0);
}

// Message number n (1-based) when it exists and is not deleted.
std::optional<std::size_t> PopSession::message_number(std::string_view arg, bool include_deleted) const {
  arg = trim_blanks(arg);
  std::size_t n = 0;
  auto r = std::from_chars(arg.data(), arg.data() + arg.size(), n);
  if (r.ec != std::errc() || n == 0 || n > index_.size()) return std::nullopt;
  if (!include_deleted && deleted_[n - 1]) return std::nullopt;
  return n - 1;
}

void PopSession::totals(std::size_t& count, std::uint64_t& octets) const {
  count = 0;
  octets = 0;
  for (std::size_t i = 0; i < index_.size(); ++i) {
    if (deleted_[i]) continue;
    ++count;
    octets += index_[i].length;
  }
}

void PopSession::drop_mailbox(Connection& c) {
  if (box_) mailbox_release(*box_, c.id());
  box_ = nullptr;
  file_.reset();
  deleted_.clear();
  index_.clear();
  listing_ = Listing::none;
}

// Where message i's text ends: before the "." line that closes it (with or
// without its line end), or at its end when a damaged file lost that line.
// Nothing when the message is not all in the file.
std::optional<std::uint64_t> PopSession::text_end(std::size_t i) const {
  const Entry& e = index_[i];
  const std::uint64_t end = e.offset + e.total_length;
  struct stat st {};
  if (::fstat(file_->get(), &st) != 0 || static_cast<std::uint64_t>(st.st_size) < end) return std::nullopt;
  const std::size_t want = static_cast<std::size_t>(std::min<std::uint64_t>(4, e.length));
  char tail[4];
  if (::pread(file_->get(), tail, want, static_cast<off_t>(end - want)) != static_cast<ssize_t>(want))
    return std::nullopt;
  std::size_t n = want;
  if (n > 0 && tail[n - 1] == '\n') --n;
  if (n > 0 && tail[n - 1] == '\r') --n;
  // The dot opens its line: behind a line end, or first in the message.
  if (n > 0 && tail[n - 1] == '.' && (n == 1 ? want == e.length : tail[n - 2] == '\n')) return end - (want - n + 1);
  return end;
}

bool PopSession::pass(Connection& c, std::string_view password) {
  if (state_ != State::user_given) {
    c.send("-ERR Invalid command; valid commands:  USER,  QUIT\r\n");
    state_ = State::authorization;
    return false;
  }
  const UserRecord* user = user_ok_ ? user_find(user_) : nullptr;
  if (!user || password.size() > kPasswordLimit || user_check_password(user->login, password) != 0) {
    // Logged whatever store.state says; the password never is.
    std::string name = user_.substr(0, kNameLimit);
    for (char& ch : name) {
      if (static_cast<unsigned char>(ch) < ' ' || ch == 0x7f) ch = '?';
    }
    log_write("POP: Login failed for: " + name + " from " + c.peer().text, logchan::main, kLogUnbuffered);
    state_ = State::authorization;
    ++failed_logins_;
    c.pause_input();  // nothing more is read until the late answer
    c.wake_after(kFailedLoginDelay);
    return true;
  }
  auto group = user_group(user->login);
  if (!group_permits(group, "mail.pop.fetch")) {
    c.send("-ERR access to this server forbidden\r\n");
    state_ = State::authorization;
    return true;
  }
  state_ = State::transaction;
  c.set_user(user->login);
  c.set_group(group);
  Mailbox* box = user->home.empty() ? nullptr : mailbox_lookup(path_join(user->home, "mail/inbox"));
  if (!box) {
    c.send("+OK 0 messages waiting\r\n");
    return true;
  }
  if (!mailbox_share_pop(*box, c.id())) {
    state_ = State::authorization;
    c.send("-ERR [IN-USE] mailbox already in use: another POP or IMAP session is currently active\r\n");
    return false;
  }
  box_ = box;
  UniqueFd fd = mailbox_open(*box);
  if (!fd) {
    drop_mailbox(c);
    c.send(strprintf("+OK 0 messages waiting for %s (no mbox)\r\n", user->login.c_str()));
    return true;
  }
  file_ = std::make_shared<const UniqueFd>(std::move(fd));
  take_snapshot();
  std::size_t count;
  std::uint64_t octets;
  totals(count, octets);
  log_message("Login:", user->login + " from " + c.peer().text, logfac::pop);
  c.send(strprintf("+OK %zu messages waiting for %s\r\n", count, user->login.c_str()));
  return true;
}

// STLS (RFC 2595): the ready reply goes in the clear, then the handshake;
// the connection drops what the client sent behind the command, and the
// session forgets a user name given in the clear.
void PopSession::stls(Connection& c) {
  if (c.secure()) {
    c.send("-ERR Already using TLS\r\n");
  } else if (state_ == State::transaction) {
    c.send("-ERR STLS is only allowed before login\r\n");
  } else if (!tls_offered(c)) {
    c.send("-ERR TLS is not available on this server\r\n");
  } else {
    c.send("+OK Begin TLS negotiation\r\n");
    c.start_tls();
    state_ = State::authorization;
    user_.clear();
    user_ok_ = false;
  }
}

// The ranges of a message's text, then the "." line that ends the reply.
// The stored text is in transmission form already; a lone "." line inside
// it (a damaged file) is stuffed, so the reply never ends early. `end` is
// where the text ends when the ranges reach it.
void PopSession::send_ranges(Connection& c, const std::vector<Range>& ranges, std::uint64_t end) {
  for (const Range& r : ranges) {
    // The client cannot tell a cut message from a whole one unless the
    // connection ends there.
    c.send_file({.file = file_, .offset = r.offset, .length = r.length,
                 .transform = FileRange::Transform::stuff_lone_dots,
                 .failure_text = "-ERR Internal error occured whilst sending message"});
  }
  char last = '\n';
  if (!ranges.empty() && ranges.back().offset + ranges.back().length == end &&
      ::pread(file_->get(), &last, 1, static_cast<off_t>(end - 1)) != 1)
    last = '\n';
  c.send(last == '\n' ? ".\r\n" : "\r\n.\r\n");
}

void PopSession::retr(Connection& c, std::string_view arg) {
  auto i = message_number(arg);
  if (!i) {
    c.send("-ERR message does not exist or has been deleted\r\n");
    return;
  }
  auto end = text_end(*i);
  if (!end) {
    c.send("-ERR bad message in mailbox (TOP)\r\n");
    return;
  }
  c.send(strprintf("+OK %llu octets\r\n", static_cast<unsigned long long>(index_[*i].length)));
  // A download is not a reading: no seen mark, and no read receipt.
  std::vector<Range> ranges;
  if (*end > text_start(*i)) ranges.push_back({text_start(*i), *end - text_start(*i)});
  send_ranges(c, ranges, *end);
}

void PopSession::top(Connection& c, std::string_view args) {
  if (index_.empty()) {
    c.send("-ERR no messages in mailbox (TOP)\r\n");
    return;
  }
  args = trim_blanks(args);
  std::size_t blank = args.find_first_of(" \t");
  auto i = message_number(args.substr(0, blank));
  if (!i) {
    c.send("-ERR no such message\r\n");
    return;
  }
  std::string_view count_text =
      blank == std::string_view::npos ? std::string_view{} : trim_blanks(args.substr(blank));
  std::uint64_t lines = 0;
  auto parsed = std::from_chars(count_text.data(), count_text.data() + count_text.size(), lines);
  if (count_text.empty() || parsed.ec != std::errc()) {
    c.send("-ERR syntax is `TOP <msg no> <lines>', eg. TOP 1 7\r\n");
    return;
  }
  auto text_stop = text_end(*i);
  if (!text_stop) {
    c.send("-ERR bad message in mailbox (TOP)\r\n");
    return;
  }
  std::uint64_t start = text_start(*i), end = *text_stop;
  // The header without the mailbox's own status lines, its empty line, then
  // the first `lines` lines of the body.
  FileSource in(file_->get());
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
      if (line_body(line.text).empty()) {
        in_header = false;
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
  c.send(strprintf("+OK %llu octets\r\n", static_cast<unsigned long long>(total)));
  send_ranges(c, ranges, end);
}

// The session's deletions are applied to the mailbox as it is now, by
// identifier: a message an IMAP session expunged meanwhile is simply gone,
// and IMAP sessions hear of those removed here.
void PopSession::quit(Connection& c) {
  std::size_t left = 0;
  bool failed = false;
  if (box_) {
    std::vector<std::uint32_t> gone;
    for (std::size_t i = 0; i < index_.size(); ++i) {
      if (deleted_[i]) gone.push_back(index_[i].uid);
    }
    std::sort(gone.begin(), gone.end());
    auto ours = [&gone](const MessageRecord& m) { return std::binary_search(gone.begin(), gone.end(), m.uid); };
    std::vector<MessageRecord*> marked;
    for (MessageRecord& m : box_->messages) {
      if (ours(m) && !(m.flags & msgflag::deleted)) {
        m.flags |= msgflag::deleted;
        marked.push_back(&m);
      }
    }
    file_.reset();  // messages still being sent keep their own hold on the file
    if (!gone.empty() && mailbox_expunge(*box_, ours) != 0) {
      for (MessageRecord* m : marked) m->flags &= ~msgflag::deleted;
      failed = true;
    }
    left = static_cast<std::size_t>(box_->count);
    drop_mailbox(c);
  }
  if (failed) {
    c.send("-ERR mailbox could not be updated, no messages were deleted\r\n");
  } else {
    c.send(strprintf("+OK %s Velmor POP3 server (%s) shutdown (%zu messages left)\r\n",
                     short_text(text_of(config.server_name)).c_str(), kVersion, left));
  }
  c.close_after_send();
}

// LIST and UIDL without an argument: queued part by part while the output
// has room; the rest comes with on_drained.
void PopSession::list_more(Connection& c) {
  while (listing_ != Listing::none && !c.output_full() && !c.closed()) {
    std::string part;
    for (std::size_t n = 0; n < kListingLines && list_next_ < index_.size(); ++list_next_) {
      if (deleted_[list_next_]) continue;
      const Entry& m = index_[list_next_];
      part += strprintf("%zu %llu\r\n", list_next_ + 1,
                        static_cast<unsigned long long>(listing_ == Listing::list ? m.length : m.uid));
      ++n;
    }
    if (list_next_ >= index_.size()) {
      part += ".\r\n";
      listing_ = Listing::none;
    }
    c.send(part);
  }
}

void PopSession::mailbox_command(Connection& c, std::string_view verb, std::string_view arg) {
  auto is = [&](std::string_view name) { return str_iequals(verb, name); };
  std::size_t count;
  std::uint64_t octets;
  if (is("STAT") || is("RSET")) {
    if (is("RSET")) std::fill(deleted_.begin(), deleted_.end(), 0);
    totals(count, octets);
    c.send(strprintf("+OK %zu %llu\r\n", count, static_cast<unsigned long long>(octets)));
  } else if (is("LIST") || is("UIDL")) {
    bool list = is("LIST");
    if (!trim_blanks(arg).empty()) {
      auto i = message_number(arg);
      if (!i) {
        c.send("-ERR no such message\r\n");
      } else {
        c.send(strprintf("+OK %zu %llu\r\n", *i + 1,
                         static_cast<unsigned long long>(list ? index_[*i].length : index_[*i].uid)));
      }
      return;
    }
    if (!list && !box_) {
      c.send("-ERR no messages in mailbox (UIDL)\r\n");
      return;
    }
    if (list) {
      totals(count, octets);
      c.send(strprintf("+OK %zu messages (%llu octets)\r\n", count, static_cast<unsigned long long>(octets)));
    } else {
      c.send("+OK\r\n");
    }
    listing_ = list ? Listing::list : Listing::uidl;
    list_next_ = 0;
    list_more(c);
  } else if (is("TOP")) {
    top(c, arg);
  } else if (is("RETR")) {
    retr(c, arg);
  } else if (is("DELE")) {
    auto i = message_number(arg, true);
    if (!i) {
      c.send("-ERR no such message\r\n");
    } else {
      deleted_[*i] = 1;
      c.send(strprintf("+OK message %zu deleted\r\n", *i + 1));
    }
  }
}

bool PopSession::command(Connection& c, std::string_view line) {
  std::size_t verb_end = line.find_first_of(" \t");
  std::string_view verb = line.substr(0, verb_end);
  std::string_view arg = verb_end == std::string_view::npos ? std::string_view{} : line.substr(verb_end + 1);
  if (verb.size() >= 10) {
    c.send("-ERR Bad command - too long\r\n");
    return false;
  }
  if (verb.empty()) {
    c.send("-ERR Bad command\r\n");
    return true;
  }
  auto is = [&](std::string_view name) { return str_iequals(verb, name); };
  if (state_ == State::transaction && (is("USER") || is("PASS"))) {
    // One login per session: the mailbox taken stays the only one.
    c.send("-ERR Invalid command; valid commands:  STAT, LIST, UIDL, TOP, RETR, DELE, RSET, NOOP, QUIT\r\n");
    return false;
  }
  if (is("USER")) {
    if (!clear_login_allowed(c.peer().ip, c.secure())) {
      // Refused before the password is sent, so it never crosses the network.
      c.send(kLoginNeedsTls);
      return true;
    }
    arg = trim_blanks(arg);
    user_ok_ = !arg.empty() && arg.size() <= kNameLimit;
    user_.assign(arg.substr(0, kNameLimit));
    state_ = State::user_given;
    c.send("+OK please send PASS command\r\n");
    return true;
  }
  if (is("PASS")) return pass(c, arg);
  if (is("CAPA")) {
    // In every state; what a client may rely on (RFC 2449): USER only where
    // a password may be sent, STLS only where it can be used.
    c.send(strprintf("+OK Capability list follows\r\n%s%sUIDL\r\nTOP\r\nPIPELINING\r\nRESP-CODES\r\n"
                     "IMPLEMENTATION Velmor-Server-Suite-%s\r\n.\r\n",
                     clear_login_allowed(c.peer().ip, c.secure()) ? "USER\r\n" : "",
                     tls_offered(c) ? "STLS\r\n" : "", kVersion));
    return true;
  }
  if (is("STLS")) {
    stls(c);
    return true;
  }
  if (is("QUIT")) {
    quit(c);
    return true;
  }
  if (is("NOOP")) {
    c.send("+OK\r\n");
    return true;
  }
  if (!(is("STAT") || is("RSET") || is("LIST") || is("UIDL") || is("TOP") || is("RETR") || is("DELE"))) {
    std::string shown(verb);
    for (char& ch : shown) {
      if (static_cast<unsigned char>(ch) < ' ' || static_cast<unsigned char>(ch) > '~') ch = '?';
    }
    c.send(strprintf("-ERR Unknown command: %s\r\n", shown.c_str()));
    return true;
  }
  if (state_ != State::transaction) {
    c.send(state_ == State::user_given ? "-ERR Invalid command; valid commands:  USER, PASS, QUIT\r\n"
                                       : "-ERR Invalid command; valid commands:  USER,  QUIT\r\n");
    return false;
  }
  mailbox_command(c, verb, arg);
  return true;
}

}  // namespace

void pop_register() {
  service_register({
      .number = svc::pop,
      .name = "pop",
      .enabled = &config.pop_sock_enabled,
      .port = &config.pop_sock_port,
      .max = &config.pop_sock_max,
      .timeout = &config.pop_sock_timeout,
      .allow = &config.pop_allow,
      .block = &config.pop_block,
      .refusal = [] { return std::string("-ERR Connection refused\r\n"); },
      .make_session = [](Connection&, Admission) { return std::make_unique<PopSession>(); },
      .line_ends = LineEnds::cr_too,
  });
}

}  // namespace velmor
