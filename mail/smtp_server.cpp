// The SMTP server (service 20). Each connection is one SmtpSession; its
// replies never overrun anything (the connection holds input back while
// output is queued), overlong lines are refused without losing the
// transaction, and a finished message waits for the group commit that runs
// after the loop's pass before it is acknowledged. What would only bounce
// later is refused while the client is still there: an unknown local
// recipient at RCPT, a message over the size limit at MAIL or at the end of
// its data.
#include "mail/smtp_server.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <ctime>
#include <memory>
#include <unordered_map>
#include <vector>

#include "core/config.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"
#include "mail/recipient.h"
#include "mail/smtp_client.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

constexpr std::size_t kEchoMax = 200;  // of a client's text echoed in a reply
constexpr std::size_t kMaxReplyLine = 2048;  // once the roles have swapped
const char* const kLocalError = "451 Requested action aborted: local error in processing\r\n";
const char* const kTooBig = "552 Message size exceeds fixed maximum message size\r\n";

std::string clip(std::string_view text, std::size_t max) { return std::string(text.substr(0, max)); }

class SmtpSession;

// The server's own state: the sessions whose message waits for the group
// commit, by the serial the commit reports back.
struct SmtpServer {
  std::unordered_map<std::uint64_t, SmtpSession*> waiting;
  std::uint64_t next_serial = 1;
};
SmtpServer& server() {
  static SmtpServer s;
  return s;
}

class SmtpSession final : public Session {
 public:
  explicit SmtpSession(bool id_verify) : id_verify_(id_verify) {}
  ~SmtpSession() override { queue_file_discard(queue_); }

  void on_open(Connection& c) override;
  void on_input(Connection& c) override;
  void on_close(Connection& c, CloseReason reason) override;
  void on_drained(Connection& c) override {
    if (turned_) turned_->on_drained(c);
  }
  // The group commit has run for this session's message.
  void committed(int error);

 private:
  enum class State {
    command,     // waiting for command lines
    data,        // receiving message data
    committing,  // the message waits for its group commit; input is paused
  };

  void command(Connection& c, std::string_view line);
  void ehlo(Connection& c, std::string_view arg);
  void help(Connection& c);
  void mail(Connection& c, std::string_view arg);
  void rcpt(Connection& c, std::string_view arg);
  void data(Connection& c);
  void vrfy(Connection& c, std::string_view arg);
  bool refused_path(Connection& c, const EnvelopePath& path, const char* syntax);
  void data_phase(Connection& c);
  void finish_message(Connection& c);
  void discard() {
    queue_file_discard(queue_);
    recipients_.clear();
    write_failed_ = false;
    oversize_ = false;
    written_ = 0;
  }
  // Writes to the queue file, counting what the file holds.
  int write(std::string_view text) {
    written_ += text.size();
    return filecache_write(queue_, text);
  }
  // "<id> <client address>": the start of the session's lines in the mail log.
  std::string log_tag(const Connection& c) const {
    return strprintf("%llu %s", static_cast<unsigned long long>(c.id()), c.peer().text.c_str());
  }

  const bool id_verify_;
  State state_ = State::command;
  Connection* conn_ = nullptr;
  std::string received_;  // the Received: text made at the start
  std::string trace_;     // received_, its date line and the X-Sender line
  CacheFile queue_;       // the queue file of the transaction (its hidden name)
  std::string queue_path_;  // the name it gets once committed
  std::string queue_hidden_;
  std::uint64_t serial_ = 0;  // identifies the session to the group commit
  int denial_ = 0;  // 1 reject list, 2 not a local user, 3 may not send now
  std::vector<std::string> recipients_;  // accepted, each once
  bool write_failed_ = false;
  std::shared_ptr<const GroupOptions> group_;  // a local sender's group
  std::string sender_;           // of the transaction, as judged
  std::uint32_t size_limit_ = 0;  // of the whole queue file; 0 = none
  std::uint64_t written_ = 0;     // bytes of the queue file so far
  bool oversize_ = false;         // the message outgrew the limit: its data is dropped
  MessageReceiver receiver_;
  std::string chunk_;
  std::unique_ptr<Session> turned_;  // the client role, after TURN
};

void SmtpSession::on_open(Connection& c) {
  conn_ = &c;
  const std::string& name = text_of(config.server_name);
  c.send(strprintf("220 %s Velmor Server Suite SMTP Server %s (v%s %s) ready at %s - Report problems to %s\r\n",
                   name.c_str(), id_verify_ ? "[ID verify]" : "", kVersion, kPlatform,
                   time_text(std::time(nullptr)).c_str(), admin_address().c_str()));
  log_write(log_tag(c) + " - SMTP Connect from " + c.peer().text, logchan::mail);
  received_ = strprintf("Received: from %s\r\n\tby %s with SMTP (Velmor Server Suite v%s %s)", c.peer().text.c_str(),
                        name.c_str(), kVersion, kPlatform);
  log_message("SMTP Server accepting connection from:", c.peer().text, logfac::house);
}

void SmtpSession::on_input(Connection& c) {
  if (turned_) {
    turned_->on_input(c);
    return;
  }
  mail_note_traffic();
  while (!c.closed() && !turned_) {
    if (state_ == State::committing) return;
    if (state_ == State::data) {
      data_phase(c);
      if (state_ == State::data) return;
      continue;
    }
    std::string_view line;
    LineResult r = c.read_line(line);
    if (r == LineResult::need_more) return;
    if (r == LineResult::overlong) {
      // Never acted on in part: what is judged is what gets stored.
      c.send("500 Line too long\r\n");
      continue;
    }
    if (!line.empty()) command(c, line);
  }
  // The peer's greeting may have come with the TURN.
  if (turned_ && !c.closed()) turned_->on_input(c);
}

void SmtpSession::on_close(Connection& c, CloseReason reason) {
  if (turned_) turned_->on_close(c, reason);
  // A message waiting for its commit is still committed (it was received
  // whole), but nobody waits for the answer.
  if (serial_) server().waiting.erase(serial_);
  serial_ = 0;
  discard();
}

// The reply to a MAIL or RCPT argument that holds no usable address.
bool SmtpSession::refused_path(Connection& c, const EnvelopePath& path, const char* syntax) {
  if (path.result == PathResult::ok) return false;
  c.send(path.result == PathResult::too_long ? "501 Address too long\r\n" : syntax);
  return true;
}

void SmtpSession::mail(Connection& c, std::string_view arg) {
  EnvelopePath path = parse_envelope_path(arg, "from", true);
  if (refused_path(c, path, "501 Syntax: MAIL FROM:<address>\r\n")) return;
  std::uint64_t declared = 0;
  SizeParameter size = mail_size_parameter(path.parameters, declared);
  if (size == SizeParameter::bad) {
    c.send("501 Syntax error in SIZE parameter\r\n");
    return;
  }
  std::string_view sender = path.address;
  discard();
  denial_ = 0;
  group_.reset();
  if (!sender.empty() && smtp_reject_match(sender)) denial_ = 1;
  if (denial_ == 0) {
    std::optional<std::string> local = mail_local_user(sender);
    bool exists = local && user_exists(*local);
    if (exists) group_ = user_group(*local);
    if (id_verify_ && local && !exists) {
      denial_ = 2;
    } else if (exists && !group_permits(group_, "mail.smtp.send")) {
      // A local sender with no group set (no groups file) is refused too.
      denial_ = 3;
    }
  }
  if (denial_ == 0) {
    // The limit debatch would apply: the sender's group, else the default
    // group's (every stranger's).
    size_limit_ = group_message_limit(group_of_sender(sender));
    if (size == SizeParameter::given && size_limit_ && declared > size_limit_) {
      c.send(kTooBig);
      return;
    }
    sender_ = sender;
    std::time_t now = server_now ? server_now : std::time(nullptr);
    trace_ = received_ + ";\r\n\t" + mail_date_text(now) + "\r\n";
    trace_ += "X-Sender: " + (sender.empty() ? std::string("Unknown") : std::string(sender)) + "\r\n";
    PendingIncoming p = queue_open_incoming_pending();
    if (!p.file) {
      c.send(kLocalError);
      return;
    }
    queue_ = std::move(p.file);
    queue_path_ = std::move(p.path);
    queue_hidden_ = std::move(p.hidden);
    // The file holds the address as judged here, never the client's line.
    if (write("MAIL FROM:<" + std::string(sender) + ">\r\n") != 0) {
      discard();
      c.send(kLocalError);
      return;
    }
  }
  c.send("250 OK Sender accepted\r\n");
}

void SmtpSession::rcpt(Connection& c, std::string_view arg) {
  if (denial_) {
    static const char* const why[] = {"", "SMTP Posting denied - mail from blocked site",
                                      "SMTP posting denied - sender not a valid local user",
                                      "SMTP posting denied - local user not allowed to send"};
    log_message(why[denial_], " (" + c.peer().text + ")", logfac::house);
    c.send("550 posting denied\r\n");
    return;
  }
  if (!queue_) {
    c.send("503 Need MAIL before RCPT\r\n");
    return;
  }
  EnvelopePath path = parse_envelope_path(arg, "to", false);
  if (refused_path(c, path, "501 Syntax: RCPT TO:<address>\r\n")) return;
  std::string_view address = path.address;
  if (std::find(recipients_.begin(), recipients_.end(), address) != recipients_.end()) {
    c.send("250 OK Recipient syntactically correct\r\n");  // once is enough
    return;
  }
  if (recipients_.size() >= kMaxRecipients) {
    c.send("452 Too many recipients\r\n");
    return;
  }
  if (group_ && !(group_->mail_flags & gflag::mail_override)) {
    const std::string& block = group_->text("mail.address.send.block");
    const std::string& allow = group_->text("mail.address.send.allow");
    if (!block.empty() && wildcard_match(address, block) && !(!allow.empty() && wildcard_match(address, allow))) {
      c.send("550 Posting to this address forbidden\r\n");
      return;
    }
  }
  // No relaying for strangers: outside recipients only from our own network.
  bool local = mail_local_user(address).has_value();
  if (!local && !relay_permitted(c.peer().ip, config.smtp_allow)) {
    c.send("550 Posting to this address forbidden\r\n");
    return;
  }
  // Debatch's own route: what it could only bounce is refused now, while
  // the client can still tell its sender (a forged sender gets nothing).
  if (local && recipient_check(address, sender_).route == RecipientRoute::unknown_user) {
    c.send("550 Unknown local user <" + clip(address, kEchoMax) + ">\r\n");
    return;
  }
  if (write("RCPT TO:<" + std::string(address) + ">\r\n") != 0) {
    discard();
    c.send(kLocalError);
    return;
  }
  recipients_.emplace_back(address);
  c.send("250 OK Recipient syntactically correct\r\n");
}

void SmtpSession::data(Connection& c) {
  if (!queue_) {
    c.send("503 Need MAIL before DATA\r\n");
    return;
  }
  if (recipients_.empty()) {
    c.send("503 Need RCPT before DATA\r\n");
    return;
  }
  if (write("DATA\r\n" + trace_) != 0) {
    discard();
    c.send(kLocalError);
    return;
  }
  receiver_ = MessageReceiver{};
  receiver_.now = server_now;
  c.send("354 Start mail input; end with <CRLF>.<CRLF>\r\n");
  state_ = State::data;
}

// Only the site's own network learns who its users are.
void SmtpSession::vrfy(Connection& c, std::string_view arg) {
  if (!relay_permitted(c.peer().ip, config.smtp_allow)) {
    c.send("252 Cannot VRFY user, but will accept message and attempt delivery\r\n");
    return;
  }
  const UserRecord* u = user_find(trim_blanks(arg.substr(0, 128)));
  if (!u) {
    c.send("550 Unknown user (Server only checks mailbox/login names)\r\n");
    return;
  }
  c.send(strprintf("250 %s <%s@%s>\r\n", clip(u->full_name, kEchoMax).c_str(), clip(u->login, kEchoMax).c_str(),
                   mail_primary_domain().c_str()));
}

// The service extensions EHLO names, one a line. What a later extension
// (STARTTLS, AUTH) offers is added here, when it applies to this client.
std::vector<std::string> extensions(const Connection& c) {
  std::vector<std::string> lines{"PIPELINING"};
  // The installation's limit, as it applies to a stranger: the peer's group.
  std::uint32_t limit = group_message_limit(c.group() ? c.group() : group_default());
  lines.push_back(limit ? "SIZE " + std::to_string(limit) : "SIZE");
  lines.push_back("8BITMIME");
  lines.push_back("HELP");
  return lines;
}

// EHLO: the greeting line, then the extensions. Like RSET, it ends a
// transaction that has begun.
void SmtpSession::ehlo(Connection& c, std::string_view arg) {
  arg = trim_blanks(arg);
  if (arg.empty()) {
    c.send("501 Syntax: EHLO hostname\r\n");
    return;
  }
  discard();
  std::vector<std::string> lines = extensions(c);
  lines.insert(lines.begin(), text_of(config.server_name) + " Hello " + clip(arg, kEchoMax) + ", how's life?");
  std::string reply;
  for (std::size_t i = 0; i < lines.size(); ++i) reply += (i + 1 < lines.size() ? "250-" : "250 ") + lines[i] + "\r\n";
  c.send(reply);
}

void SmtpSession::help(Connection& c) {
  c.send("214-Commands:\r\n"
         "214-  HELO EHLO MAIL RCPT DATA\r\n"
         "214-  RSET NOOP VRFY HELP QUIT\r\n"
         "214 Report problems to " + clip(admin_address(), kEchoMax) + "\r\n");
}

// One command line (without its line end).
void SmtpSession::command(Connection& c, std::string_view line) {
  std::size_t verb_end = std::min(line.find(' '), line.size());
  std::string_view verb = line.substr(0, std::min<std::size_t>(verb_end, 10));
  std::string_view arg = line.substr(std::min(verb.size() + 1, line.size()));
  // Credentials never reach a log, whoever offers them.
  std::string_view logged = str_iequals(verb, "auth") ? verb : line;
  log_write(log_tag(c) + " - " + clip(logged, 254), logchan::mail);
  if (verb.size() > 8) c.send("500 Bad command - too long\r\n");
  if (verb.empty()) return;
  if (str_iequals(verb, "helo")) {
    c.send("250 Hello " + clip(arg, kEchoMax) + ", how's life?\r\n");
  } else if (str_iequals(verb, "ehlo")) {
    ehlo(c, arg);
  } else if (str_iequals(verb, "help")) {
    help(c);
  } else if (str_iequals(verb, "mail")) {
    mail(c, arg);
  } else if (str_iequals(verb, "rcpt")) {
    rcpt(c, arg);
  } else if (str_iequals(verb, "data")) {
    data(c);
  } else if (str_iequals(verb, "rset")) {
    discard();
    c.send("250 Reset OK\r\n");
  } else if (str_iequals(verb, "noop")) {
    c.send("250 OK\r\n");
  } else if (str_iequals(verb, "quit")) {
    log_message("SMTP server closing connection to ", c.peer().text, logfac::house);
    c.send(strprintf("221 %s Velmor SMTP Server (%s) closing connection at %s\r\n",
                     text_of(config.server_name).c_str(), kVersion, time_text(std::time(nullptr)).c_str()));
    c.close_after_send();
  } else if (str_iequals(verb, "vrfy")) {
    vrfy(c, arg);
  } else if (str_iequals(verb, "turn")) {
    // Only a peer we relay for may take the queue: the roles swap, and from
    // now on this connection is an SMTP client waiting for their greeting.
    if (!address_list_match(config.smtp_allow, c.peer().ip)) {
      c.send("502 TURN not available\r\n");
      return;
    }
    discard();
    c.send("250 OK\r\n");
    log_write(strprintf("%llu - TURN: sending the queue to %s", static_cast<unsigned long long>(c.id()),
                        c.peer().text.c_str()),
              logchan::mail);
    c.set_line_limit(kMaxReplyLine);
    turned_ = smtp_turn_session();
    turned_->on_open(c);
  } else {
    c.send("500 Unknown command:" + std::string(verb) + "\r\n");
  }
}

void SmtpSession::data_phase(Connection& c) {
  chunk_.clear();
  std::string headers;
  std::string_view in = c.buffered();
  std::size_t used = receiver_.feed(in, false, chunk_, &headers);
  // A line longer than the whole buffer is passed on in parts.
  if (used == 0 && c.input_full()) used = receiver_.feed(in, true, chunk_, &headers);
  c.consume(used);
  if (!headers.empty()) log_header_summary(log_tag(c), headers);
  if (!oversize_ && size_limit_ && written_ + chunk_.size() > size_limit_) {
    // Past the limit: the rest is read and dropped, and the file goes now.
    oversize_ = true;
    queue_file_discard(queue_);
  }
  if (!oversize_ && !write_failed_ && !chunk_.empty() && write(chunk_) != 0) write_failed_ = true;
  if (receiver_.done()) finish_message(c);
}

// The whole message is in: it is flushed now and committed with every other
// message finished in this pass; the reply waits for that commit.
void SmtpSession::finish_message(Connection& c) {
  if (oversize_) {
    log_write(strprintf("%s - message refused: larger than %u bytes", log_tag(c).c_str(), size_limit_), logchan::mail);
    discard();
    c.send(kTooBig);
    state_ = State::command;
    return;
  }
  int rc = write_failed_ ? EIO : filecache_purge(queue_);
  if (rc != 0) {
    log_write("SMTP: message from " + c.peer().text + " not queued, the queue file could not be written: " + queue_path_,
              logchan::errors);
    unlink(queue_hidden_.c_str());
    discard();
    c.send(kLocalError);
    state_ = State::command;
    return;
  }
  serial_ = server().next_serial++;
  server().waiting[serial_] = this;
  queue_commit_later(queue_path_, queue_hidden_, [serial = serial_](int error) {
    auto& waiting = server().waiting;
    auto it = waiting.find(serial);
    if (it == waiting.end()) return;  // its connection has closed meanwhile
    SmtpSession* s = it->second;
    waiting.erase(it);
    s->committed(error);
  });
  state_ = State::committing;
  c.pause_input();
}

void SmtpSession::committed(int error) {
  serial_ = 0;
  recipients_.clear();
  state_ = State::command;
  if (!conn_) return;
  conn_->send(error == 0 ? "250 OK\r\n" : kLocalError);
  conn_->resume_input();
}

}  // namespace

void smtp_register() {
  service_register({
      .number = svc::smtp,
      .name = "smtp",
      .enabled = &config.smtp_sock_enabled,
      .port = &config.smtp_sock_port,
      .max = &config.smtp_sock_max,
      .timeout = &config.smtp_sock_timeout,
      .allow = &config.smtp_allow,
      .block = &config.smtp_block,
      .auth = &config.smtp_auth,
      .refusal = [] { return "421 " + text_of(config.server_name) + " connection refused\r\n"; },
      .make_session = [](Connection&, Admission a) { return std::make_unique<SmtpSession>(a == Admission::identify); },
      .line_limit = kMaxCommandLine,
      .line_ends = LineEnds::cr_too,
  });
  queue_commit_register();  // one commit for every message finished in a pass
}

}  // namespace velmor
