// The POP3 client: one PopClientSession per account and run. Replies are
// taken in the order the commands went; a message is read up to its
// terminator line into a hidden incoming file, handed to the queue's group
// commit with the others finished about the same time, and only its commit
// lets its DELE go out.
#include "mail/pop_client.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <ctime>
#include <deque>
#include <map>
#include <set>
#include <unordered_map>
#include <utility>

#include "core/config.h"
#include "core/connection.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/textfile.h"
#include "core/util.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"
#include "mail/recipient.h"

namespace velmor {

namespace {

// Commands on their way at once when the server pipelines.
constexpr std::size_t kWindow = 64;
// Messages asked for ahead of the one arriving.
constexpr int kRetrAhead = 16;
// Finished messages committed together (one sync for all of them) ...
constexpr std::size_t kBatch = 32;
// ... or once the first of them has waited this long.
constexpr auto kBatchWait = std::chrono::milliseconds(500);
// Messages received and not yet committed: no more are asked for.
constexpr std::size_t kMaxUnsettled = 64;
// The largest message fetched when the default group sets no mail.msg.size.
constexpr std::uint64_t kMessageCeiling = 64ull * 1024 * 1024;

class PopClientSession;

// What the client knows of an account's messages between sessions. A
// message is known by its UIDL, or, on a server without UIDL, by " <number>"
// (no UIDL holds a blank), which holds only for a session that follows one
// cut short (it deleted nothing, so the numbers stand) and is never saved.
struct Memory {
  std::set<std::string> done;     // in the queue: skipped, and deleted unless kept
  std::set<std::string> too_big;  // left on the server as over the limit
  std::string path;                // the state file `done` is kept in
  bool dirty = false;              // `done` is not yet in the state file
};

struct PopClient {
  // Accounts with a connection (user, host and port): the serial of the
  // session that holds each, which alone may free it.
  std::map<std::string, std::uint64_t> busy;
  std::unordered_map<std::uint64_t, PopClientSession*> live;  // by serial, for the commits
  std::map<std::string, Memory> memory;                       // by account
  std::uint64_t next_serial = 1;
  std::time_t next_run = 0;
};
PopClient& client() {
  static PopClient c;
  return c;
}

std::string account_key(const PopAccount& a) {
  return a.user + '\n' + a.host + ':' + std::to_string(a.port);
}

bool number_key(std::string_view id) { return !id.empty() && id.front() == ' '; }

// The account's state file: beside the incoming folder, named by a digest
// of the account, so any user or host name makes a plain file name.
std::string state_path(const std::string& key) {
  return path_join(path_join(path_dir(queue_incoming_dir()), "pop"), md5_hex(key));
}

Memory& memory_of(const std::string& key) { return client().memory[key]; }

// Writes the account's record of queued messages when it changed: a
// temporary file, synced and renamed into place (an empty record removes
// the file).
void save_memory(const std::string& key, const PopAccount& account) {
  Memory& m = memory_of(key);
  if (!m.dirty) return;
  std::string text = pop_state_text(account, m.done);
  int rc = 0;
  if (text.empty()) {
    if (rc = filecache_delete(m.path); rc == ENOENT) rc = 0;
  } else {
    make_path(std::string(path_dir(m.path)));
    rc = file_write_atomic(m.path, text, false, 0600);
  }
  if (rc != 0) {
    log_write(strprintf("POP client: the record of %s's fetched messages could not be saved: %s",
                        account.address().c_str(), error_text(rc).c_str()),
              logchan::errors);
    return;
  }
  m.dirty = false;
}

class PopClientSession final : public Session {
 public:
  // `follows_cut` for the session that carries on a run cut short.
  PopClientSession(PopAccount account, bool follows_cut)
      : account_(std::move(account)), key_(account_key(account_)), serial_(client().next_serial++) {
    client().live[serial_] = this;
    const std::uint32_t limit = group_message_limit(group_of_sender(account_.address()));
    limit_ = limit ? limit : kMessageCeiling;
    if (!follows_cut) {
      // The state file is what counts (whoever changed it meanwhile).
      Memory& m = memory_of(key_);
      m.path = state_path(key_);
      auto text = read_text_file(m.path);
      m.done = text ? pop_state_parse(*text) : std::set<std::string>{};
      m.dirty = false;
      std::erase_if(m.too_big, number_key);
    }
  }
  ~PopClientSession() override { release(); }

  void on_open(Connection& c) override;
  void on_input(Connection& c) override;
  void on_timer(Connection& c) override;
  void on_close(Connection& c, CloseReason reason) override;
  // The group commit has run for message `number`.
  void committed(std::uint32_t number, int error);
  std::uint64_t serial() const { return serial_; }

 private:
  enum class Command { greeting, stls, user, pass, capa, stat, list, uidl, retr, dele, quit };
  enum class Reading {
    reply,    // status lines
    listing,  // the lines of a CAPA, LIST or UIDL answer, up to "."
    message,  // a message, up to its terminator line
  };
  struct Finished {
    std::string path, hidden;
    std::uint32_t number;
  };

  void send(Connection& c, Command command, std::string_view text, std::uint32_t number = 0);
  void reply(Connection& c, std::string_view line);
  void listing_line(std::string_view line);
  void listing_done(Connection& c, Command done);
  static const char* command_name(Command command);
  void stat(Connection& c, std::string_view line);
  void plan();
  bool skipped(std::uint32_t number) const;
  std::string id_of(std::uint32_t number) const {
    auto it = uids_.find(number);
    return it != uids_.end() ? it->second : " " + std::to_string(number);
  }
  void start_message(std::uint32_t number);
  bool read_message(Connection& c);
  void finish_message(Connection& c);
  void over_limit(Connection& c);
  void hand_over();
  void pump(Connection& c);
  void give_up(Connection& c) {
    c.send("QUIT\r\n");
    c.close_after_send();
  }
  void stop(std::string_view why);
  void discard_unsettled();
  void release();

  const PopAccount account_;
  const std::string key_;
  const std::uint64_t serial_;
  std::uint64_t limit_ = kMessageCeiling;  // the largest message taken
  Connection* conn_ = nullptr;
  std::string trace_;  // the Received: lines before their date

  std::deque<std::pair<Command, std::uint32_t>> sent_;  // awaiting their replies, in order
  Reading reading_ = Reading::reply;
  Command listing_ = Command::capa;  // what the lines being read answer
  bool pipelining_ = false;
  // STAT's count, then what LIST and UIDL said of the messages (by number;
  // only what the server sent, so a count it made up costs no memory).
  std::uint32_t count_ = 0;
  std::unordered_map<std::uint32_t, std::uint64_t> sizes_;
  std::unordered_map<std::uint32_t, std::string> uids_;
  bool uidl_listed_ = false;
  std::deque<Command> listings_;  // LIST and UIDL, still to send
  int listings_out_ = 0;          // sent, not yet answered in full
  bool planned_ = false;          // the listings are in: messages may be asked for
  std::uint32_t next_ = 0;     // the next message to consider, downwards (0: none left)
  int retrs_out_ = 0;          // RETR commands not yet answered in full
  bool stopping_ = false;      // ask for nothing more; settle and QUIT
  bool quit_sent_ = false;
  bool cut_ = false;           // ended over a message too large: the run goes on without it
  bool released_ = false;

  // The message arriving.
  std::uint32_t number_ = 0;
  std::uint64_t received_ = 0;
  PendingIncoming file_;
  bool write_failed_ = false;
  MessageReceiver receiver_;
  std::string chunk_, headers_;

  std::vector<Finished> finished_;  // flushed, waiting to be handed to the commit
  std::size_t committing_ = 0;      // handed to the commit, not yet done
  std::deque<std::uint32_t> to_delete_;  // committed; DELE not yet sent
  std::uint32_t fetched_ = 0;
};

// Once, at the close or (for a session never connected) at its end: by
// the time the session itself goes, a new run may hold the account.
void PopClientSession::release() {
  if (released_) return;
  released_ = true;
  client().live.erase(serial_);
  if (auto it = client().busy.find(key_); it != client().busy.end() && it->second == serial_) client().busy.erase(it);
  discard_unsettled();
  save_memory(key_, account_);
  if (client().live.empty() && (status_bits & status::pop_client_running))
    status_bits = (status_bits & ~status::pop_client_running) | status::pop_client_ended | status::changed;
}

// A message half received, or received and not handed to the commit, is
// thrown away: nothing was deleted for it, so the next run fetches it.
void PopClientSession::discard_unsettled() {
  if (file_.file) {
    queue_file_discard(file_.file);
    unlink(file_.hidden.c_str());
  }
  for (const Finished& f : finished_) unlink(f.hidden.c_str());
  finished_.clear();
}

void PopClientSession::on_open(Connection& c) {
  conn_ = &c;
  if (account_.tls == PopTls::implicit &&
      c.start_tls_client(account_.host, TlsVerify::peer) != Connection::TlsStart::started) {
    c.close_now(CloseReason::tls_failed);
    return;
  }
  sent_.emplace_back(Command::greeting, 0);
  trace_ = strprintf("Received: from %s [%s]\r\n\tby %s with POP3 (Velmor %s);\r\n\t", account_.host.c_str(),
                     c.peer().text.c_str(), text_of(config.server_name).c_str(), kVersion);
  log_message("POP3 client connected to: ", c.peer().text, logfac::house);
}

const char* PopClientSession::command_name(Command command) {
  static const char* const names[] = {"the greeting", "STLS", "USER", "PASS", "CAPA", "STAT",
                                      "LIST",         "UIDL", "RETR", "DELE", "QUIT"};
  return names[static_cast<int>(command)];
}

void PopClientSession::on_close(Connection&, CloseReason reason) {
  if (reason == CloseReason::lookup_failed || reason == CloseReason::connect_failed) {
    log_message("POP client fail", {}, logfac::pop);
    log_message("POP3 client hostname lookup failed", {}, logfac::house);
  } else if (reason == CloseReason::tls_failed) {
    log_message(strprintf("POP client - TLS with %s failed (is its certificate trusted and for that name?); the "
                          "password is not sent",
                          account_.host.c_str()));
  } else if (!quit_sent_ && reason != CloseReason::requested) {
    // Where it stood: what a silent or confused server left it waiting for.
    std::string waiting;
    if (reading_ == Reading::message) {
      waiting = strprintf(", in the middle of message %u", number_);
    } else if (reading_ == Reading::listing) {
      waiting = strprintf(", waiting for the end of the answer to %s", command_name(listing_));
    } else if (!sent_.empty()) {
      waiting = strprintf(", waiting for the answer to %s", command_name(sent_.front().first));
      if (sent_.front().second) waiting += " " + std::to_string(sent_.front().second);
    }
    log_message(strprintf("POP client - connection to %s ended (%s) after %u messages%s", account_.host.c_str(),
                          close_reason_text(reason), fetched_, waiting.c_str()));
  }
  log_message("POP client dispose", {}, logfac::pop);
  conn_ = nullptr;
  if (cut_) {
    // The rest of the run goes on over a new connection, which skips the
    // message too large and deletes what this one queued.
    auto next = std::make_unique<PopClientSession>(account_, true);
    client().busy[key_] = next->serial();
    connect_to(svc::pop_client, account_.host, account_.port, std::move(next));
  }
  release();
}

void PopClientSession::send(Connection& c, Command command, std::string_view text, std::uint32_t number) {
  sent_.emplace_back(command, number);
  c.send(text);
}

void PopClientSession::on_input(Connection& c) {
  mail_note_traffic();
  while (!c.closed()) {
    if (reading_ == Reading::message) {
      if (!read_message(c)) return;
      pump(c);
      continue;
    }
    std::string_view line;
    LineResult r = c.read_line(line);
    if (r == LineResult::need_more) return;
    if (r == LineResult::overlong) {
      log_message("POP client - reply too long from ", account_.host);
      c.close_now();
      return;
    }
    if (reading_ == Reading::listing) {
      if (line == ".") {
        reading_ = Reading::reply;
        listing_done(c, listing_);
        pump(c);
      } else {
        listing_line(line);
      }
      continue;
    }
    reply(c, line);
    pump(c);
  }
}

void PopClientSession::on_timer(Connection& c) {
  hand_over();
  pump(c);
}

// One status line: the answer to the oldest command still waiting.
void PopClientSession::reply(Connection& c, std::string_view line) {
  if (sent_.empty()) {
    log_message("POP client - unexpected reply from ", account_.host);
    c.close_now();
    return;
  }
  auto [command, number] = sent_.front();
  sent_.pop_front();
  const bool positive = !line.empty() && line.front() == '+';
  switch (command) {
    case Command::greeting:
      if (!positive) {
        log_message("POP client - connect failed to ", account_.host, logfac::pop);
        c.close_now();
        return;
      }
      if (account_.tls == PopTls::stls && !c.secure()) {
        send(c, Command::stls, "STLS\r\n");
        break;
      }
      send(c, Command::user, "USER " + account_.user + "\r\n");
      break;
    case Command::stls:
      if (!positive || c.start_tls_client(account_.host, TlsVerify::peer) != Connection::TlsStart::started) {
        log_message(strprintf("POP client - %s refused STLS; the password is not sent", account_.host.c_str()));
        give_up(c);
        return;
      }
      // Goes out under TLS, once the handshake is done.
      send(c, Command::user, "USER " + account_.user + "\r\n");
      break;
    case Command::user:
      if (!positive) {
        log_message(strprintf("POP client - Bad user %s", account_.user.c_str()), {}, logfac::pop);
        give_up(c);
        return;
      }
      send(c, Command::pass, "PASS " + account_.password + "\r\n");
      break;
    case Command::pass:
      if (!positive) {
        log_message(strprintf("POP client - Bad password for %s", account_.user.c_str()), {}, logfac::pop);
        give_up(c);
        return;
      }
      // Whether the server takes commands ahead of its answers.
      send(c, Command::capa, "CAPA\r\n");
      break;
    case Command::capa:
    case Command::list:
    case Command::uidl:
      if (positive) {
        reading_ = Reading::listing;
        listing_ = command;
      } else {
        listing_done(c, command);  // a server without it
      }
      break;
    case Command::stat:
      stat(c, line);
      break;
    case Command::retr:
      if (positive) {
        start_message(number);
      } else {
        --retrs_out_;
        log_message("Couldn't fetch article, server said:", line.substr(0, 128), logfac::house);
      }
      break;
    case Command::dele:
      if (!positive) log_message(strprintf("POP client - DELE %u refused: ", number), line.substr(0, 128));
      break;
    case Command::quit:
      log_message("POP client closing connection", {}, logfac::house);
      c.close_after_send();
      break;
  }
}

// A line of a listing: a capability, or "<number> <size>" (LIST) or
// "<number> <uidl>" (UIDL, 1 to 70 visible characters). Lines that are
// none of these are passed over.
void PopClientSession::listing_line(std::string_view line) {
  if (listing_ == Command::capa) {
    if (str_iequals(trim_blanks(line), "PIPELINING")) pipelining_ = true;
    return;
  }
  std::size_t blank = line.find(' ');
  if (blank == std::string_view::npos) return;
  std::uint64_t n = 0;
  auto r = std::from_chars(line.data(), line.data() + blank, n);
  if (r.ec != std::errc() || r.ptr != line.data() + blank || n == 0 || n > count_) return;
  std::string_view value = trim_blanks(line.substr(blank + 1));
  if (listing_ == Command::list) {
    std::uint64_t size = 0;
    auto s = std::from_chars(value.data(), value.data() + value.size(), size);
    if (s.ec == std::errc()) sizes_[static_cast<std::uint32_t>(n)] = size;
  } else if (pop_uidl_valid(value)) {
    uids_[static_cast<std::uint32_t>(n)] = std::string(value);
    uidl_listed_ = true;
  }
}

// The answer to CAPA, LIST or UIDL is complete (or was a refusal).
void PopClientSession::listing_done(Connection& c, Command done) {
  if (done == Command::capa) {
    send(c, Command::stat, "STAT\r\n");
  } else if (--listings_out_ == 0 && listings_.empty()) {
    plan();
  }
}

void PopClientSession::stat(Connection& c, std::string_view line) {
  std::string_view rest = line.size() > 3 ? trim_blanks(line.substr(3)) : std::string_view();
  std::size_t digits = 0;
  std::uint64_t count = 0;
  while (digits < rest.size() && rest[digits] >= '0' && rest[digits] <= '9' && count <= 0xffffffffu)
    count = count * 10 + static_cast<unsigned>(rest[digits++] - '0');
  if (line.empty() || line.front() != '+' || digits == 0 || count > 0xffffffffu) {
    log_message("POP Client - Server does not understand STAT", {}, logfac::house);
    give_up(c);
    return;
  }
  log_message("POP client fetching articles: ", line.substr(1, 128), logfac::house);
  count_ = static_cast<std::uint32_t>(count);
  if (count_ == 0) {
    uidl_listed_ = true;  // an empty maildrop lists nothing: everything remembered is gone
    plan();
    return;
  }
  // The sizes (a message announced over the limit is not fetched) and the
  // identifiers (a message queued before is not fetched again).
  listings_ = {Command::list, Command::uidl};
}

// What to do with each message, the last one first, as the queue has always
// received them: delete it unfetched (queued before), leave it (too large),
// or fetch it. The first two are found from the listings and the record
// (so this costs what they hold, whatever count STAT gave); pump asks for
// the others as it counts down.
void PopClientSession::plan() {
  Memory& m = memory_of(key_);
  if (uidl_listed_) {
    // Messages no longer on the server are forgotten.
    std::set<std::string> listed;
    for (const auto& [n, id] : uids_) listed.insert(id);
    auto gone = [&listed](const std::string& id) { return !number_key(id) && !listed.count(id); };
    if (std::erase_if(m.done, gone)) m.dirty = true;
    std::erase_if(m.too_big, gone);
  }
  std::vector<std::uint32_t> known;
  for (const auto& [n, id] : uids_) {
    if (m.done.count(id)) known.push_back(n);
  }
  for (const std::string& id : m.done) {
    if (!number_key(id)) continue;
    std::uint32_t n = static_cast<std::uint32_t>(std::stoul(id.substr(1)));
    if (n <= count_ && !uids_.count(n)) known.push_back(n);
  }
  std::sort(known.rbegin(), known.rend());
  if (!account_.keep) to_delete_.insert(to_delete_.end(), known.begin(), known.end());
  if (!known.empty())
    log_message(strprintf("POP client - %zu messages of %s were fetched before", known.size(),
                          account_.address().c_str()),
                {}, logfac::house);
  for (const auto& [n, size] : sizes_) {
    if (size <= limit_ || skipped(n)) continue;
    m.too_big.insert(id_of(n));
    log_message(strprintf("POP client - message %u of %s is %llu bytes, over the limit of %llu: left on the server", n,
                          account_.address().c_str(), static_cast<unsigned long long>(size),
                          static_cast<unsigned long long>(limit_)));
  }
  next_ = count_;
  planned_ = true;
}

// A message not to be fetched: queued before, or too large.
bool PopClientSession::skipped(std::uint32_t number) const {
  const Memory& m = client().memory[key_];
  std::string id = id_of(number);
  return m.done.count(id) || m.too_big.count(id);
}

// A positive answer to RETR: the message follows, into a hidden incoming
// file behind its envelope and trace.
void PopClientSession::start_message(std::uint32_t number) {
  number_ = number;
  received_ = 0;
  reading_ = Reading::message;
  write_failed_ = false;
  receiver_ = MessageReceiver{};
  receiver_.add_date = false;
  if (stopping_) return;  // read and dropped: nothing more is queued
  file_ = queue_open_incoming_pending();
  if (!file_.file) {
    log_message("Couldn't open new incoming file", {}, logfac::house);
    stop("the incoming file could not be made");
    return;
  }
  std::time_t now = server_now ? server_now : std::time(nullptr);
  std::string address = account_.address();
  std::string head = "POP3 MAIL FROM:<" + address + ">\r\nRCPT TO:<" + address + ">\r\nDATA\r\n" + trace_ +
                     mail_date_text(now) + "\r\n";
  if (filecache_write(file_.file, head) != 0) write_failed_ = true;
}

// Takes what has arrived of the message; true once its terminator has.
bool PopClientSession::read_message(Connection& c) {
  chunk_.clear();
  headers_.clear();
  std::string_view in = c.buffered();
  std::size_t used = receiver_.feed(in, false, chunk_, &headers_);
  // A line longer than the whole buffer is taken in parts.
  if (used == 0 && c.input_full()) used = receiver_.feed(in, true, chunk_, &headers_);
  c.consume(used);
  received_ += used;
  if (received_ > limit_) {
    over_limit(c);
    return false;
  }
  if (!headers_.empty()) log_header_summary(static_cast<int>(c.id()), headers_);
  if (file_.file && !write_failed_ && !chunk_.empty() && filecache_write(file_.file, chunk_) != 0)
    write_failed_ = true;
  if (!receiver_.done()) return false;
  finish_message(c);
  return true;
}

// A message longer than the limit (whatever its size was said to be): it
// is dropped and stays on the server, and since its end cannot be waited
// for, the connection ends; a new one carries on with the rest.
void PopClientSession::over_limit(Connection& c) {
  log_message(strprintf("POP client - message %u of %s is over the limit of %llu bytes: dropped, left on the server",
                        number_, account_.address().c_str(), static_cast<unsigned long long>(limit_)));
  memory_of(key_).too_big.insert(id_of(number_));
  cut_ = true;
  c.close_now();
}

void PopClientSession::finish_message(Connection& c) {
  reading_ = Reading::reply;
  --retrs_out_;
  if (!file_.file) return;
  int rc = write_failed_ ? EIO : filecache_purge(file_.file);
  if (rc != 0) {
    log_write(strprintf("POP client: message %u of %s not queued: %s", number_, account_.address().c_str(),
                        error_text(rc).c_str()),
              logchan::errors);
    queue_file_discard(file_.file);
    unlink(file_.hidden.c_str());
    file_ = PendingIncoming{};
    stop("an incoming file could not be written");
    return;
  }
  finished_.push_back({std::move(file_.path), std::move(file_.hidden), number_});
  file_ = PendingIncoming{};
  ++fetched_;
  // Committed together with those that follow closely (pump hands them
  // over once the batch is full or nothing more is coming), at the latest
  // after a short wait.
  if (finished_.size() == 1) c.wake_after(kBatchWait);
}

// The finished messages go to the next group commit (after this pass).
void PopClientSession::hand_over() {
  if (finished_.empty()) return;
  if (conn_) conn_->wake_after(std::chrono::milliseconds(0));
  for (Finished& f : finished_) {
    ++committing_;
    queue_commit_later(std::move(f.path), std::move(f.hidden),
                       [serial = serial_, number = f.number, key = key_, account = account_, id = id_of(f.number)](
                           int error) {
                         auto& live = client().live;
                         auto it = live.find(serial);
                         if (it != live.end()) {
                           it->second->committed(number, error);
                         } else if (error == 0) {
                           // The session has gone: the message is queued all
                           // the same, and must not be fetched again.
                           Memory& m = memory_of(key);
                           m.done.insert(id);
                           m.dirty = true;
                           save_memory(key, account);
                         }
                       });
  }
  finished_.clear();
}

void PopClientSession::committed(std::uint32_t number, int error) {
  --committing_;
  if (error != 0) {
    stop("an incoming file could not be committed");
  } else {
    Memory& m = memory_of(key_);
    m.done.insert(id_of(number));
    m.dirty = true;
    if (!account_.keep) to_delete_.push_back(number);
  }
  if (conn_ && !conn_->closed()) pump(*conn_);
}

void PopClientSession::stop(std::string_view why) {
  if (!stopping_)
    log_message(strprintf("POP client - fetching from %s stopped: ", account_.address().c_str()), why);
  stopping_ = true;
}

// Sends what may go now: the listings, the DELEs of committed messages, the
// next RETRs, and QUIT once everything asked for is settled.
void PopClientSession::pump(Connection& c) {
  if (quit_sent_ || c.closed()) return;
  // Without pipelining a command waits for the whole answer to the last
  // one, a message included.
  auto room = [&] { return pipelining_ ? sent_.size() < kWindow : sent_.empty() && reading_ == Reading::reply; };
  while (!listings_.empty() && room()) {
    Command l = listings_.front();
    listings_.pop_front();
    ++listings_out_;
    send(c, l, l == Command::list ? "LIST\r\n" : "UIDL\r\n");
  }
  if (!planned_) return;
  while (next_ > 0 && skipped(next_)) --next_;
  const bool last = retrs_out_ == 0 && (next_ == 0 || stopping_);
  if (finished_.size() >= kBatch || (last && !finished_.empty())) hand_over();
  while (!to_delete_.empty() && room()) {
    std::uint32_t n = to_delete_.front();
    to_delete_.pop_front();
    send(c, Command::dele, strprintf("DELE %u\r\n", n), n);
  }
  while (!stopping_ && next_ > 0 && room() && retrs_out_ < kRetrAhead &&
         finished_.size() + committing_ < kMaxUnsettled) {
    send(c, Command::retr, strprintf("RETR %u\r\n", next_), next_);
    ++retrs_out_;
    --next_;
    while (next_ > 0 && skipped(next_)) --next_;
  }
  if ((next_ == 0 || stopping_) && retrs_out_ == 0 && finished_.empty() && committing_ == 0 &&
      to_delete_.empty() && room()) {
    // Recorded before QUIT lets the server delete: a session cut before
    // QUIT's answer leaves the messages there, and the next one knows them.
    save_memory(key_, account_);
    quit_sent_ = true;
    send(c, Command::quit, "QUIT\r\n");
  }
}

}  // namespace

// ---- accounts ---------------------------------------------------------------

namespace {

constexpr std::uint16_t kPop3sPort = 995;
// "pop3://" says what no scheme says; a user named like a scheme ("pop3s:"
// then a password starting "//") is the one line these forms change.
constexpr std::pair<std::string_view, PopTls> kSchemes[] = {
    {"pop3s://", PopTls::implicit}, {"pop3+stls://", PopTls::stls}, {"pop3://", PopTls::none}};

}  // namespace

std::vector<PopAccount> pop_accounts_parse(std::string_view text) {
  std::vector<PopAccount> accounts;
  std::size_t pos = 0;
  while (pos <= text.size()) {
    std::size_t end = text.find_first_of(",\r\n", pos);
    if (end == std::string_view::npos) end = text.size();
    std::string_view entry = trim_blanks(text.substr(pos, end - pos));
    pos = end + 1;
    PopAccount a;
    while (!entry.empty() && (entry.front() == '-' || entry.front() == '*')) {
      if (entry.front() == '-') a.keep = true;
      entry.remove_prefix(1);
    }
    for (const auto& [scheme, tls] : kSchemes) {
      if (entry.size() > scheme.size() && str_iequals(entry.substr(0, scheme.size()), scheme)) {
        a.tls = tls;
        entry.remove_prefix(scheme.size());
        break;
      }
    }
    if (a.tls == PopTls::implicit) a.port = kPop3sPort;
    std::size_t colon = entry.find(':');
    std::size_t at = entry.rfind('@');
    if (colon == std::string_view::npos || at == std::string_view::npos || at < colon || colon == 0) continue;
    a.user = std::string(entry.substr(0, colon));
    a.password = std::string(entry.substr(colon + 1, at - colon - 1));
    std::string_view host = entry.substr(at + 1);
    if (std::size_t port_at = host.find(':'); port_at != std::string_view::npos) {
      const int port = port_number(host.substr(port_at + 1));
      host = host.substr(0, port_at);
      if (port == 0) continue;
      a.port = static_cast<std::uint16_t>(port);
    }
    if (host.empty() || host.find_first_of(" \t") != std::string_view::npos) continue;  // no name holds a blank
    a.host = std::string(host);
    accounts.push_back(std::move(a));
  }
  return accounts;
}

std::string pop_accounts_show(const std::vector<PopAccount>& accounts) {
  std::string out;
  for (const PopAccount& a : accounts) {
    out += a.keep ? "-*" : "*";
    if (a.tls == PopTls::implicit) out += "pop3s://";
    if (a.tls == PopTls::stls) out += "pop3+stls://";
    out += a.user + ":" + a.password + "@" + a.host;
    if (a.port != (a.tls == PopTls::implicit ? kPop3sPort : 110)) out += ":" + std::to_string(a.port);
    out += "\n";
  }
  return out;
}

// ---- the record of fetched messages ------------------------------------------------

bool pop_uidl_valid(std::string_view uidl) {
  if (uidl.empty() || uidl.size() > 70) return false;
  for (char ch : uidl) {
    if (ch < 0x21 || ch > 0x7e) return false;
  }
  return true;
}

std::set<std::string> pop_state_parse(std::string_view text) {
  std::set<std::string> ids;
  for_each_line(text, [&](std::string_view line) {
    if (pop_uidl_valid(line)) ids.emplace(line);
  });
  return ids;
}

std::string pop_state_text(const PopAccount& account, const std::set<std::string>& ids) {
  std::string text;
  for (const std::string& id : ids) {
    if (!pop_uidl_valid(id)) continue;  // a number stands for one session only
    if (text.empty()) text = strprintf("# messages of %s:%u already queued\n", account.address().c_str(), account.port);
    text += id + "\n";
  }
  return text;
}

// ---- runs -----------------------------------------------------------------------

std::unique_ptr<Session> pop_client_session(PopAccount account) {
  return std::make_unique<PopClientSession>(std::move(account), false);
}

int pop_fetch_run() {
  PopClient& pc = client();
  std::time_t now = server_now ? server_now : std::time(nullptr);
  pc.next_run = now + static_cast<std::time_t>(config.pop_time) * 60;
  log_message("POP3 client fetch check - next one at: ", time_text(pc.next_run), logfac::house);
  if (!link_up) return 0;
  int started = 0;
  for (PopAccount& a : pop_accounts_parse(text_of(config.pop_hosts))) {
    std::string key = account_key(a);
    if (pc.busy.count(key)) continue;
    // Its address heads each fetched message's envelope, and must read back whole.
    if (!envelope_address_fits(a.address())) {
      log_message("POP client - account unusable in an envelope: ", a.address());
      continue;
    }
    std::string host = a.host;
    std::uint16_t port = a.port;
    auto session = std::make_unique<PopClientSession>(std::move(a), false);
    pc.busy[key] = session->serial();
    if (connect_to(svc::pop_client, host, port, std::move(session))) ++started;
  }
  if (started) status_bits |= status::pop_client_running | status::changed;
  return started;
}

void pop_client_poll() {
  if (link_up && config.pop_time > 0 && server_now > client().next_run) pop_fetch_run();
}

void pop_client_register() {
  client().next_run = server_now ? server_now : std::time(nullptr);
  service_register({
      .number = svc::pop_client,
      .name = "pop client",
      .timeout = &config.pop_sock_timeout,
  });
  queue_commit_register();
  hooks.popkick = [] { return pop_fetch_run() > 0; };
  hooks.pop_client_count = [] { return connection_count(svc::pop_client); };
}

}  // namespace velmor
