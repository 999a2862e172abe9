// The SMTP server (service 20). Each connection is one SmtpSession; its
// replies never overrun anything (the connection holds input back while
// output is queued), overlong lines are refused without losing the
// transaction, and a finished message waits for the group commit that runs
// after the loop's pass before it is acknowledged. What would only bounce
// later is refused while the client is still there: an unknown local
// recipient at RCPT, a message over the size limit at MAIL or at the end of
// its data.
//
// STARTTLS upgrades the connection in place, and the session then forgets
// everything the clear-text part of the dialogue told it. AUTH (PLAIN and
// LOGIN) checks the user database; it is offered only over TLS, or to a
// loopback peer on the plain port. The submission listeners (STARTTLS on
// one, TLS from the first byte on the other) take mail only from an
// authenticated user; an authenticated user whose group may send may relay.
#include "mail/smtp_server.h"

#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <chrono>
#include <ctime>
#include <memory>
#include <unordered_map>
#include <utility>
#include <vector>

#include "core/config.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/tls.h"
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
const char* const kNeedTls = "530 5.7.0 Must issue a STARTTLS command first\r\n";
const char* const kBadCredentials = "535 5.7.8 Authentication credentials invalid\r\n";

constexpr std::size_t kNameLimit = 64;        // of a login name, as POP3 takes it
constexpr std::size_t kPasswordLimit = 256;
// A refused password is answered this much later (other clients are served
// meanwhile), and the connection ends after this many refusals, so guessing
// is slow.
constexpr std::chrono::milliseconds kFailedLoginDelay{1000};
constexpr int kFailedLoginLimit = 3;

// The listeners for mail submission: mail only from an authenticated user.
bool submission_port(const Connection& c) { return c.service() == svc::submission || c.service() == svc::smtps; }

// A client's base64 answer in an AUTH exchange, strictly: false when the
// text is not base64 (so junk is refused, never half-read). "=" is the empty
// answer of an initial response.
bool sasl_decode(std::string_view text, std::string& out) {
  out.clear();
  if (text == "=" || text.empty()) return true;
  if (text.size() % 4 != 0) return false;
  std::size_t pad = text.ends_with("==") ? 2 : text.ends_with("=") ? 1 : 0;
  for (std::size_t i = 0; i + pad < text.size(); ++i) {
    char ch = text[i];
    if (!std::isalnum(static_cast<unsigned char>(ch)) && ch != '+' && ch != '/') return false;
  }
  out = base64_decode(text);
  return true;
}

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
  void on_timer(Connection& c) override;
  // The group commit has run for this session's message.
  void committed(int error);

 private:
  enum class State {
    command,     // waiting for command lines
    data,        // receiving message data
    committing,  // the message waits for its group commit; input is paused
  };

  // What the next line of an AUTH exchange answers.
  enum class AuthStep { none, plain, login_name, login_password };

  void command(Connection& c, std::string_view line);
  void ehlo(Connection& c, std::string_view arg);
  std::vector<std::string> extensions(const Connection& c) const;
  bool auth_offered(const Connection& c) const;
  void auth(Connection& c, std::string_view arg);
  void auth_answer(Connection& c, std::string_view line);
  void check_plain(Connection& c, const std::string& response);
  void check_login(Connection& c, std::string_view name, std::string_view password);
  void starttls(Connection& c, std::string_view arg);
  std::string received(const Connection& c) const;
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
  std::string trace_;     // the Received: text, its date line and the X-Sender line
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
  AuthStep auth_step_ = AuthStep::none;
  std::string login_name_;  // LOGIN: the name, while the password is asked for
  std::string auth_user_;   // the login name the client proved ("" = none)
  std::shared_ptr<const GroupOptions> auth_group_;
  int failed_logins_ = 0;
  bool hello_needed_ = false;  // after STARTTLS, until the client greets again
};

void SmtpSession::on_open(Connection& c) {
  conn_ = &c;
  const std::string& name = text_of(config.server_name);
  c.send(strprintf("220 %s Velmor Server Suite SMTP Server %s (v%s %s) ready at %s - Report problems to %s\r\n",
                   name.c_str(), id_verify_ ? "[ID verify]" : "", kVersion, kPlatform,
                   time_text(std::time(nullptr)).c_str(), admin_address().c_str()));
  log_write(log_tag(c) + " - SMTP Connect from " + c.peer().text, logchan::mail);
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
      if (auth_step_ != AuthStep::none) {
        auth_step_ = AuthStep::none;
        login_name_.clear();
        c.send("500 5.5.6 Authentication Exchange line is too long\r\n");
        continue;
      }
      c.send("500 Line too long\r\n");
      continue;
    }
    if (auth_step_ != AuthStep::none) {
      auth_answer(c, line);  // never logged: it carries credentials
    } else if (!line.empty()) {
      command(c, line);
    }
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
  if (hello_needed_) {
    c.send("503 5.5.1 Send EHLO first\r\n");
    return;
  }
  if (c.service() == svc::submission && !c.secure()) {
    c.send(kNeedTls);
    return;
  }
  if (submission_port(c) && auth_user_.empty()) {
    c.send("530 5.7.0 Authentication required\r\n");
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
    // A peer that must identify itself proves a local sender with AUTH:
    // only the authenticated user may send in that user's name.
    const UserRecord* claimed = exists ? user_find(*local) : nullptr;
    if (id_verify_ && local && (!claimed || !str_iequals(claimed->login, auth_user_))) {
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
    trace_ = received(c) + ";\r\n\t" + mail_date_text(now) + "\r\n";
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
  // No relaying for strangers: outside recipients only from our own network,
  // or from a user who proved who they are and whose group may send.
  bool local = mail_local_user(address).has_value();
  bool relay = relay_permitted(c.peer().ip, config.smtp_allow) ||
               (!auth_user_.empty() && group_permits(auth_group_, "mail.smtp.send"));
  if (!local && !relay) {
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

// Passwords travel only encrypted, or inside this host; the submission
// port on which STARTTLS is offered wants it first from everyone.
bool SmtpSession::auth_offered(const Connection& c) const {
  return c.secure() || (c.peer().loopback() && c.service() != svc::submission);
}

// The service extensions EHLO names, one a line, as they apply to this client.
std::vector<std::string> SmtpSession::extensions(const Connection& c) const {
  std::vector<std::string> lines{"PIPELINING"};
  // The installation's limit, as it applies to a stranger: the peer's group.
  std::uint32_t limit = group_message_limit(c.group() ? c.group() : group_default());
  lines.push_back(limit ? "SIZE " + std::to_string(limit) : "SIZE");
  lines.push_back("8BITMIME");
  lines.push_back("HELP");
  if (!c.secure() && tls_available()) lines.push_back("STARTTLS");
  if (auth_offered(c)) lines.push_back("AUTH PLAIN LOGIN");
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
  hello_needed_ = false;
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
    hello_needed_ = false;
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
  } else if (str_iequals(verb, "starttls")) {
    starttls(c, arg);
  } else if (str_iequals(verb, "auth")) {
    auth(c, arg);
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

// The Received: text of a message: the protocol word says how it came
// (ESMTPS under TLS, ESMTPA with AUTH, ESMTPSA with both), and an
// authenticated sender is named.
std::string SmtpSession::received(const Connection& c) const {
  const bool authed = !auth_user_.empty();
  const char* word = c.secure() ? (authed ? "ESMTPSA" : "ESMTPS") : (authed ? "ESMTPA" : "SMTP");
  std::string who = authed ? " (authenticated as " + auth_user_ + ")" : "";
  return strprintf("Received: from %s%s\r\n\tby %s with %s (Velmor Server Suite v%s %s)", c.peer().text.c_str(),
                   who.c_str(), text_of(config.server_name).c_str(), word, kVersion, kPlatform);
}

void SmtpSession::starttls(Connection& c, std::string_view arg) {
  if (!trim_blanks(arg).empty()) {
    c.send("501 5.5.4 Syntax: STARTTLS\r\n");
    return;
  }
  if (c.secure()) {
    c.send("503 5.5.1 TLS already active\r\n");
    return;
  }
  if (!tls_available()) {
    c.send("454 4.7.0 TLS not available due to temporary reason\r\n");
    return;
  }
  c.send("220 2.0.0 Ready to start TLS\r\n");
  if (c.start_tls() != Connection::TlsStart::started) {
    // The client was told to start: it cannot be told otherwise now.
    c.close_after_send();
    return;
  }
  // Nothing the clear-text dialogue said carries over: the client greets
  // again, starts its transaction again, and proves who it is again.
  discard();
  denial_ = 0;
  group_.reset();
  auth_user_.clear();
  auth_group_.reset();
  c.set_user("");
  c.set_group(group_default());
  hello_needed_ = true;
  log_write(log_tag(c) + " - TLS started", logchan::mail);
}

void SmtpSession::auth(Connection& c, std::string_view arg) {
  if (hello_needed_) {
    c.send("503 5.5.1 Send EHLO first\r\n");
    return;
  }
  if (!auth_user_.empty()) {
    c.send("503 5.5.1 Already authenticated\r\n");
    return;
  }
  if (queue_) {
    c.send("503 5.5.1 AUTH not permitted during a mail transaction\r\n");
    return;
  }
  if (!auth_offered(c)) {
    c.send(c.service() == svc::submission
               ? kNeedTls
               : "538 5.7.11 Encryption required for requested authentication mechanism\r\n");
    return;
  }
  arg = trim_blanks(arg);
  std::size_t blank = std::min(arg.find(' '), arg.size());
  std::string_view mechanism = arg.substr(0, blank);
  std::string_view initial = trim_blanks(arg.substr(blank));
  if (mechanism.empty()) {
    c.send("501 5.5.4 Syntax: AUTH mechanism\r\n");
    return;
  }
  const bool plain = str_iequals(mechanism, "plain");
  if (!plain && !str_iequals(mechanism, "login")) {
    c.send("504 5.5.4 Unrecognized authentication type\r\n");
    return;
  }
  if (initial.empty()) {
    auth_step_ = plain ? AuthStep::plain : AuthStep::login_name;
    c.send(plain ? "334 \r\n" : "334 VXNlcm5hbWU6\r\n");  // "Username:"
    return;
  }
  // The initial response: PLAIN's whole answer, or LOGIN's name.
  auth_step_ = plain ? AuthStep::plain : AuthStep::login_name;
  auth_answer(c, initial);
}

// One answer of an AUTH exchange.
void SmtpSession::auth_answer(Connection& c, std::string_view line) {
  AuthStep step = auth_step_;
  auth_step_ = AuthStep::none;
  line = trim_blanks(line);
  if (line == "*") {
    login_name_.clear();
    c.send("501 5.7.0 Authentication cancelled\r\n");
    return;
  }
  std::string decoded;
  if (!sasl_decode(line, decoded)) {
    login_name_.clear();
    c.send("501 5.5.2 Cannot decode response\r\n");
    return;
  }
  switch (step) {
    case AuthStep::plain:
      check_plain(c, decoded);
      break;
    case AuthStep::login_name:
      login_name_ = std::move(decoded);
      auth_step_ = AuthStep::login_password;
      c.send("334 UGFzc3dvcmQ6\r\n");  // "Password:"
      break;
    case AuthStep::login_password:
      check_login(c, std::exchange(login_name_, {}), decoded);
      break;
    case AuthStep::none:
      break;
  }
}

// PLAIN: "authorisation identity NUL name NUL password"; a client may act
// only as itself, so the identity is empty or the name.
void SmtpSession::check_plain(Connection& c, const std::string& response) {
  std::size_t first = response.find('\0');
  std::size_t second = first == std::string::npos ? first : response.find('\0', first + 1);
  if (second == std::string::npos) {
    check_login(c, "", "");
    return;
  }
  std::string_view text(response);
  std::string_view identity = text.substr(0, first);
  std::string_view name = text.substr(first + 1, second - first - 1);
  std::string_view password = text.substr(second + 1);
  if (!identity.empty() && !str_iequals(identity, name)) password = {};  // refused below, as any wrong password
  check_login(c, name, password);
}

void SmtpSession::check_login(Connection& c, std::string_view name, std::string_view password) {
  const UserRecord* user = !name.empty() && name.size() <= kNameLimit ? user_find(name) : nullptr;
  if (!user || password.empty() || password.size() > kPasswordLimit ||
      user_check_password(user->login, password) != 0) {
    // The name and the peer are logged; the password never is.
    std::string shown(name.substr(0, kNameLimit));
    for (char& ch : shown) {
      if (static_cast<unsigned char>(ch) < ' ' || ch == 0x7f) ch = '?';
    }
    log_write("SMTP: Login failed for: " + shown + " from " + c.peer().text, logchan::main, kLogUnbuffered);
    ++failed_logins_;
    c.pause_input();  // nothing more is read until the late answer
    c.wake_after(kFailedLoginDelay);
    return;
  }
  auth_user_ = user->login;
  auth_group_ = user_group(user->login);
  c.set_user(user->login);
  c.set_group(auth_group_);
  log_write(log_tag(c) + " - authenticated as " + user->login, logchan::mail);
  c.send("235 2.7.0 Authentication successful\r\n");
}

// The answer to a refused password, a second late.
void SmtpSession::on_timer(Connection& c) {
  if (turned_) {
    turned_->on_timer(c);
    return;
  }
  c.send(kBadCredentials);
  if (failed_logins_ >= kFailedLoginLimit) {
    c.close_after_send();
    return;
  }
  c.resume_input();
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
