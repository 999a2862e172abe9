// The SMTP client. A run starts one connection per route that has mail no
// connection holds; each connection greets, then takes its route's entries
// one by one: it checks the file is a whole queue file, builds the envelope
// from the addresses it parsed, sends the message (a stray "." line inside
// it goes out as ".."), and settles the entry by the replies: delivered
// (deleted), refused for good (back to its sender, then deleted), or kept
// for later, holding only the recipients still to do.
#include "mail/smtp_client.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "core/config.h"
#include "core/connection.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/mailfile.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"
#include "mail/smtp_reply.h"

namespace velmor {

namespace {

constexpr std::uint16_t kSmtpPort = 25;
// Mail still refused temporarily this long after it was queued goes back.
constexpr std::time_t kGiveUpAfter = 5 * 24 * 3600;
// A route whose run failed is left alone by the poll this long.
constexpr std::time_t kRouteRetry = 60;
// Reply lines are short; a longer one is not a reply.
constexpr std::size_t kReplyLineLimit = 2048;

std::string lower(std::string_view s) {
  std::string out(s);
  for (char& c : out) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return out;
}

void note_running();

// Does an EHLO reply offer this extension (the first word of a line)?
bool offers(std::string_view reply, std::string_view extension) {
  while (!reply.empty()) {
    std::string_view line = reply.substr(0, reply.find('\n'));
    reply.remove_prefix(std::min(reply.size(), line.size() + 1));
    if (line.size() < 4) continue;
    line.remove_prefix(4);
    if (str_iequals(line.substr(0, line.find(' ')), extension)) return true;
  }
  return false;
}

// The SASL mechanisms an EHLO reply lists ("AUTH PLAIN LOGIN", or the
// older "AUTH=LOGIN"), upper-cased.
std::vector<std::string> auth_mechanisms(std::string_view reply) {
  std::vector<std::string> found;
  while (!reply.empty()) {
    std::string_view line = reply.substr(0, reply.find('\n'));
    reply.remove_prefix(std::min(reply.size(), line.size() + 1));
    if (line.size() < 9 || !str_iequals(line.substr(4, 4), "AUTH") || (line[8] != ' ' && line[8] != '=')) continue;
    line.remove_prefix(9);
    while (!line.empty()) {
      std::size_t start = line.find_first_not_of(" =");
      if (start == std::string_view::npos) break;
      line.remove_prefix(start);
      std::string_view word = line.substr(0, line.find_first_of(" ="));
      line.remove_prefix(word.size());
      std::string upper(word);
      for (char& ch : upper) ch = static_cast<char>(std::toupper(static_cast<unsigned char>(ch)));
      found.push_back(std::move(upper));
    }
  }
  return found;
}

// ---- routes ------------------------------------------------------------------

struct Route {
  std::string name;  // as the entries write it
  int id = 0;        // the claim of its connection on the entries
  std::vector<std::string> hosts;
  std::uint16_t port = kSmtpPort;
  std::string user, password;  // the relay's login (none for mail exchangers)
  std::size_t next_host = 0;
  bool awaiting_mx = false;
  std::uint64_t lookup = 0;
  bool temporary_failure = false;  // something was kept for later
};

struct Client {
  std::map<std::string, Route> routes;  // by lower-cased route name
  std::map<std::string, std::time_t> retry_at;
  int turn_sessions = 0;
  int next_id = 1;
  std::time_t last_run = 0;
};
Client& client() {
  static Client c;
  return c;
}

OutgoingEntry* find_entry(const std::string& path) {
  for (OutgoingEntry& e : queue_outgoing_entries())
    if (e.path == path) return &e;
  return nullptr;
}

void release_claims(int id) {
  for (OutgoingEntry& e : queue_outgoing_entries())
    if (e.holder == id) e.holder = -1;
}

// A refused message goes back to its sender with `text`; the file leaves the
// queue once the error mail is safely queued (or was not due: the null
// sender, or a loop, which moves the file to oddments).
void return_to_sender(const std::string& path, std::string_view text) {
  ErrorMail sent = send_error_mail(text, "", path);
  if (sent == ErrorMail::failed) {
    log_write("SMTP client: could not return " + path + " to its sender; it stays queued", logchan::errors);
    return;
  }
  if (sent != ErrorMail::moved) unlink(path.c_str());
  queue_drop_outgoing(path);
}

void end_route(const std::string& key, bool failed) {
  Client& cl = client();
  auto it = cl.routes.find(key);
  if (it == cl.routes.end()) return;
  if (it->second.lookup) net_cancel_lookup(it->second.lookup);
  if (failed || it->second.temporary_failure) cl.retry_at[key] = server_now + kRouteRetry;
  release_claims(it->second.id);
  log_message("SMTP client run ended: ", it->second.name, logfac::house);
  cl.routes.erase(it);
  note_running();
}

void connect_next(const std::string& key);
bool connect_host(Route& r, const std::string& host, bool plain_only);

// Every message of a route no connection holds goes back to its sender.
void return_route(const std::string& key, const std::string& text) {
  auto it = client().routes.find(key);
  if (it == client().routes.end()) return;
  const std::string name = it->second.name;
  std::vector<std::string> paths;
  for (const OutgoingEntry& e : queue_outgoing_entries())
    if (e.holder < 0 && str_iequals(e.route, name)) paths.push_back(e.path);
  end_route(key, false);
  for (const std::string& p : paths) return_to_sender(p, text);
}

void mx_answered(const std::string& key, int id, MxAnswer answer) {
  Client& cl = client();
  auto it = cl.routes.find(key);
  if (it == cl.routes.end() || it->second.id != id) return;
  Route& r = it->second;
  r.awaiting_mx = false;
  r.lookup = 0;
  switch (answer.result) {
    case MxResult::found:
      r.hosts = std::move(answer.hosts);
      // A lone mail exchanger named "." says the domain takes no mail.
      if (r.hosts.size() == 1 && (r.hosts[0].empty() || r.hosts[0] == ".")) {
        return_route(key, "SMTP Mail delivery failed.\nThe domain " + r.name + " accepts no mail.\n");
        return;
      }
      break;
    case MxResult::none:
      r.hosts = {r.name};
      break;
    case MxResult::no_such_domain:
      log_message("SMTP client: no such domain: ", r.name, logfac::smtp);
      return_route(key, "SMTP Mail delivery failed.\nThe domain " + r.name + " does not exist.\n");
      return;
    case MxResult::failed:
      log_message("SMTP client: mail exchanger lookup failed: ", r.name, logfac::smtp);
      end_route(key, true);
      return;
  }
  connect_next(key);
}

// Starts the route's connection; false when none could start.
bool start_route(const std::string& name) {
  Client& cl = client();
  const std::string key = lower(name);
  if (cl.routes.count(key)) return false;
  Route& r = cl.routes[key];
  r.name = name;
  r.id = cl.next_id++;
  note_running();
  if (str_iequals(name, "default")) {
    SmtpRelay relay;
    RelayParse parsed = smtp_relay_parse(text_of(config.smtp_hosts), relay);
    if (parsed != RelayParse::ok) {
      if (parsed == RelayParse::none)
        log_message("SMTP client: no relay host (smtp.hosts) for the default route", {}, logfac::smtp);
      else
        log_write("SMTP client: smtp.hosts is not [user:password@]host[:port]; the mail stays queued", logchan::mail);
      end_route(key, true);
      return false;
    }
    r.hosts = {std::move(relay.host)};
    r.port = relay.port;
    r.user = std::move(relay.user);
    r.password = std::move(relay.password);
    connect_next(key);
  } else {
    r.awaiting_mx = true;
    const int id = r.id;
    std::uint64_t handle =
        net_lookup_mail_exchangers(name, [key, id](MxAnswer a) { mx_answered(key, id, std::move(a)); });
    auto it = cl.routes.find(key);
    if (it != cl.routes.end() && it->second.id == id && it->second.awaiting_mx) it->second.lookup = handle;
  }
  return cl.routes.count(key) > 0;
}

// ---- one message -------------------------------------------------------------

struct Message {
  std::string path;
  std::time_t queued = 0;
  std::string sender;
  std::vector<std::string> recipients;
  std::shared_ptr<const UniqueFd> fd;
  std::uint64_t body_offset = 0;
  std::uint64_t length = 0;
  std::vector<std::uint64_t> lone_dots;  // where a line holding only "." starts
  std::size_t next_rcpt = 0;
  std::vector<std::size_t> accepted, later, refused;
  std::string later_reason, refused_reason;
};

enum class Load { ok, skip, odd };

}  // namespace

std::vector<std::uint64_t> lone_dot_lines(ByteSource& in, std::uint64_t from, std::uint64_t to, bool& whole) {
  std::vector<std::uint64_t> found;
  enum { text, dot, dot_cr } state = text;
  bool line_start = true;
  std::uint64_t dot_at = 0;
  whole = true;
  for (std::uint64_t pos = from; pos < to;) {
    std::string_view v = in.view(pos, 1);
    if (v.empty()) {
      whole = false;
      break;
    }
    v = v.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(v.size(), to - pos)));
    for (std::size_t i = 0; i < v.size(); ++i) {
      const char ch = v[i];
      if (state == dot && ch == '\r') {
        state = dot_cr;
        continue;
      }
      if ((state == dot || state == dot_cr) && ch == '\n') found.push_back(dot_at);
      state = text;
      if (line_start && ch == '.') {
        state = dot;
        dot_at = pos + i;
      }
      line_start = ch == '\n';
    }
    pos += v.size();
  }
  return found;
}

namespace {

// Reads the file whole before anything is sent: a file that is not a whole
// queue file is never sent in part.
Load load_message(Message& m, std::string& reason) {
  int raw = open(m.path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (raw < 0) return Load::skip;
  auto fd = std::make_shared<const UniqueFd>(raw);
  struct stat st {};
  if (fstat(raw, &st) != 0 || !S_ISREG(st.st_mode)) return Load::skip;
  FileSource in(raw);
  QueueEnvelope env = queue_read_envelope(in);
  if (in.failed()) return Load::skip;
  const std::uint64_t length = in.size();
  if (env.damaged) {
    reason = "SMTP client: envelope line too long";
    return Load::odd;
  }
  if (env.recipients.empty()) {
    reason = "SMTP client: no recipient";
    return Load::odd;
  }
  if (!env.has_data) {
    reason = "SMTP client: no DATA line";
    return Load::odd;
  }
  if (!env.has_sender_bracket || (!env.sender.empty() && !envelope_address_fits(env.sender)) ||
      std::any_of(env.recipients.begin(), env.recipients.end(),
                  [](const std::string& r) { return r.empty() || !envelope_address_fits(r); })) {
    reason = "SMTP client: bad envelope address";
    return Load::odd;
  }
  // The terminator: "\r\n.\r\n" at the end ("." alone for an empty message).
  std::string_view tail = length >= 5 ? in.view(length - 5, 5) : std::string_view{};
  bool whole = length >= env.body_offset + 3 && tail.size() >= 5 && tail.substr(0, 5) == "\r\n.\r\n";
  if (!whole) {
    reason = "SMTP client: no terminator at the end of the message";
    return Load::odd;
  }
  // Lines holding only "." before the terminator would end the message early.
  bool read_whole = true;
  m.lone_dots = lone_dot_lines(in, env.body_offset, length - 3, read_whole);
  if (!read_whole) return Load::skip;
  m.sender = env.sender;
  m.recipients = env.recipients;
  m.fd = std::move(fd);
  m.body_offset = env.body_offset;
  m.length = length;
  return Load::ok;
}

// ---- the session -------------------------------------------------------------

// Where a route's connection goes, and how it may log in there.
struct Target {
  std::string host;  // the name connected to: SNI, and checked in the certificate
  std::string user, password;
  bool plain_only = false;  // the retry after a failed handshake: no STARTTLS
};

class SmtpClientSession final : public Session {
 public:
  SmtpClientSession(std::string route, int id, bool turned, Target target = {})
      : route_(std::move(route)), id_(id), turned_(turned), target_(std::move(target)) {}

  void on_open(Connection& c) override {
    if (!turned_)
      log_message("SMTP client connected to: ", c.peer().text, logfac::house);
  }
  void on_input(Connection& c) override;
  void on_close(Connection& c, CloseReason reason) override;

 private:
  enum class Step { greeting, ehlo, helo, starttls, auth, auth_user, auth_password, mail, rcpt, data, dot, rset, quit };

  void answer(Connection& c);
  // After the EHLO (or HELO) reply: STARTTLS, the login, or the first message.
  void greeted(Connection& c, bool ehlo);
  // The relay's login cannot go on: no password goes, the mail stays queued.
  void no_login(Connection& c, std::string_view why);
  void next_message(Connection& c);
  void send_rcpt(Connection& c);
  void send_body(Connection& c);
  // A recipient's outcome from a 4xx or 5xx reply; false for any other.
  // (the connection is closed at any other).
  bool refused(Connection& c, std::size_t recipient, std::string_view after);
  void settle(Connection& c, bool reset);
  void quit(Connection& c) {
    c.send("QUIT\r\n");
    step_ = Step::quit;
  }

  std::string route_;
  int id_;
  bool turned_;
  Target target_;
  bool reached_ = false;  // the server greeted us
  bool failed_ = false;   // ended for a reason a retry soon would not mend
  bool pipelining_ = false;  // MAIL, RCPT and DATA go out together
  bool mail_ok_ = false;     // the transaction's MAIL was taken
  Step step_ = Step::greeting;
  SmtpReply reply_;
  std::unique_ptr<Message> msg_;
};

void SmtpClientSession::on_input(Connection& c) {
  mail_note_traffic();
  while (!c.closed()) {
    std::string_view line;
    LineResult r = c.read_line(line);
    if (r == LineResult::need_more) return;
    ReplyRead got = r == LineResult::overlong ? ReplyRead::malformed : reply_.add(line);
    if (got == ReplyRead::need_more) continue;
    if (got == ReplyRead::malformed) {
      log_write(strprintf("SMTP client: not an SMTP reply from %s; connection ended", c.peer().text.c_str()),
                logchan::mail);
      c.close_now();
      return;
    }
    log_message("SMTP reponse no:", std::to_string(reply_.code()), logfac::smtp);
    answer(c);
    reply_.clear();
  }
}

void SmtpClientSession::answer(Connection& c) {
  const int kind = reply_.kind();
  if (reply_.code() == 421) {
    // The server is closing: the message in hand and the rest stay queued.
    log_write(strprintf("SMTP client: %s said: %s", c.peer().text.c_str(), reply_.text().c_str()), logchan::mail);
    c.close_now();
    return;
  }
  switch (step_) {
    case Step::greeting:
      if (kind != 2) {
        log_write(strprintf("SMTP client: %s greeted with: %s", c.peer().text.c_str(), reply_.text().c_str()),
                  logchan::mail);
        quit(c);
        return;
      }
      reached_ = true;
      c.send("EHLO " + text_of(config.server_name) + "\r\n");
      step_ = Step::ehlo;
      return;
    case Step::ehlo:
      if (kind == 5) {  // an older server: plain HELO
        c.send("HELO " + text_of(config.server_name) + "\r\n");
        step_ = Step::helo;
        return;
      }
      [[fallthrough]];
    case Step::helo:
      if (kind != 2) {
        quit(c);
        return;
      }
      greeted(c, step_ == Step::ehlo);
      return;
    case Step::starttls:
      if (reply_.code() == 220 &&
          c.start_tls_client(target_.host, target_.user.empty() ? TlsVerify::none : TlsVerify::peer) ==
              Connection::TlsStart::started) {
        c.send("EHLO " + text_of(config.server_name) + "\r\n");
        step_ = Step::ehlo;
      } else if (!target_.user.empty()) {
        no_login(c, "STARTTLS was refused: " + reply_.text());
      } else {
        next_message(c);  // on in plain text, as before
      }
      return;
    case Step::auth_user:
    case Step::auth_password:
      if (reply_.code() == 334) {
        c.send(base64_encode(step_ == Step::auth_user ? target_.user : target_.password) + "\r\n");
        step_ = step_ == Step::auth_user ? Step::auth_password : Step::auth;
        return;
      }
      [[fallthrough]];
    case Step::auth:
      if (reply_.code() == 235) {
        log_message("SMTP client logged in as: ", target_.user, logfac::smtp);
        next_message(c);
        return;
      }
      log_write(strprintf("SMTP client: %s refused the login of %s: %s; the mail stays queued",
                          c.peer().text.c_str(), target_.user.c_str(), reply_.text().c_str()),
                logchan::mail);
      failed_ = true;
      quit(c);
      return;
    case Step::mail:
      mail_ok_ = kind == 2;
      step_ = Step::rcpt;
      if (mail_ok_) {
        if (!pipelining_) send_rcpt(c);
        return;
      }
      for (std::size_t i = 0; i < msg_->recipients.size(); ++i)
        if (!refused(c, i, "MAIL FROM")) return;
      if (!pipelining_) settle(c, true);
      return;
    case Step::rcpt: {
      // After a refused MAIL, the replies to the commands sent behind it
      // say nothing about the recipients.
      std::size_t i = msg_->next_rcpt++;
      if (!mail_ok_) {
      } else if (kind == 2) {
        msg_->accepted.push_back(i);
      } else if (!refused(c, i, "RCPT TO")) {
        return;
      }
      if (msg_->next_rcpt < msg_->recipients.size()) {
        if (!pipelining_) send_rcpt(c);
      } else if (pipelining_) {
        step_ = Step::data;
      } else if (msg_->accepted.empty()) {
        settle(c, true);
      } else {
        c.send("DATA\r\n");
        step_ = Step::data;
      }
      return;
    }
    case Step::data:
    case Step::dot: {
      const bool at_data = step_ == Step::data;
      if (at_data && reply_.code() == 354) {
        if (!msg_->accepted.empty()) {
          send_body(c);
        } else {
          // A pipelined DATA taken with nobody to send to: an empty end.
          c.send(".\r\n");
          step_ = Step::dot;
        }
        return;
      }
      if (!at_data && kind == 2 && !msg_->accepted.empty()) {
        log_write(strprintf("SMTP client: %s sent to %s", msg_->path.c_str(), c.peer().text.c_str()), logchan::mail);
        msg_->accepted.clear();
        settle(c, false);
        return;
      }
      std::vector<std::size_t> accepted;
      accepted.swap(msg_->accepted);
      for (std::size_t i : accepted)
        if (!refused(c, i, at_data ? "DATA" : "the end of the message")) return;
      settle(c, at_data);
      return;
    }
    case Step::rset:
      if (kind != 2) {
        quit(c);
        return;
      }
      next_message(c);
      return;
    case Step::quit:
      c.close_after_send();
      return;
  }
}

void SmtpClientSession::greeted(Connection& c, bool ehlo) {
  const std::string& text = reply_.text();
  pipelining_ = ehlo && offers(text, "PIPELINING");
  if (ehlo && !turned_ && !target_.plain_only && !c.secure() && offers(text, "STARTTLS")) {
    c.send("STARTTLS\r\n");
    step_ = Step::starttls;
    return;
  }
  if (target_.user.empty()) {
    next_message(c);
    return;
  }
  if (!c.secure()) {
    no_login(c, "it offers no STARTTLS");
    return;
  }
  std::vector<std::string> mechanisms = auth_mechanisms(text);
  auto has = [&](std::string_view m) { return std::find(mechanisms.begin(), mechanisms.end(), m) != mechanisms.end(); };
  if (has("PLAIN")) {
    c.send("AUTH PLAIN " + base64_encode(std::string(1, '\0') + target_.user + '\0' + target_.password) + "\r\n");
    step_ = Step::auth;
  } else if (has("LOGIN")) {
    c.send("AUTH LOGIN\r\n");
    step_ = Step::auth_user;
  } else {
    no_login(c, "it offers neither AUTH PLAIN nor AUTH LOGIN");
  }
}

void SmtpClientSession::no_login(Connection& c, std::string_view why) {
  log_write(strprintf("SMTP client: no login to %s: %.*s; the password is not sent and the mail stays queued",
                      c.peer().text.c_str(), static_cast<int>(why.size()), why.data()),
            logchan::mail);
  failed_ = true;
  quit(c);
}

bool SmtpClientSession::refused(Connection& c, std::size_t recipient, std::string_view after) {
  const int kind = reply_.kind();
  if (kind != 4 && kind != 5) {
    // A reply that makes no sense here: stop, and keep the message.
    log_write(strprintf("SMTP client: unexpected reply after %.*s: %s", static_cast<int>(after.size()), after.data(),
                        reply_.text().c_str()),
              logchan::mail);
    c.close_now();
    return false;
  }
  std::string note = "Remote server said after " + std::string(after) + " (" + msg_->recipients[recipient] +
                     "):\n" + reply_.text() + "\n";
  if (kind == 4) {
    msg_->later.push_back(recipient);
    msg_->later_reason = note;
  } else {
    msg_->refused.push_back(recipient);
    if (msg_->refused_reason.size() < 4 * SmtpReply::kMaxText) msg_->refused_reason += note;
  }
  return true;
}

void SmtpClientSession::send_rcpt(Connection& c) {
  c.send("RCPT TO:<" + msg_->recipients[msg_->next_rcpt] + ">\r\n");
}

// The message as stored (already in transmission form), with a "." put in
// front of each line that holds only "." before its terminator.
void SmtpClientSession::send_body(Connection& c) {
  std::uint64_t pos = msg_->body_offset;
  for (std::uint64_t dot : msg_->lone_dots) {
    if (dot > pos) c.send_file({.file = msg_->fd, .offset = pos, .length = dot - pos});
    c.send(".");
    pos = dot;
  }
  c.send_file({.file = msg_->fd, .offset = pos, .length = msg_->length - pos});
  step_ = Step::dot;
}

void SmtpClientSession::next_message(Connection& c) {
  for (;;) {
    OutgoingEntry* pick = nullptr;
    for (OutgoingEntry& e : queue_outgoing_entries())
      if (e.holder < 0 && str_iequals(e.route, route_)) {
        pick = &e;
        break;
      }
    if (!pick) {
      quit(c);
      return;
    }
    pick->holder = id_;
    auto m = std::make_unique<Message>();
    m->path = pick->path;
    m->queued = pick->mtime;
    std::string reason;
    Load got = load_message(*m, reason);
    if (got == Load::skip) {
      if (access(m->path.c_str(), F_OK) != 0) queue_drop_outgoing(m->path);
      continue;  // stays held: not tried again on this connection
    }
    if (got == Load::odd) {
      queue_drop_outgoing(m->path);
      mail_move_to_oddments(m->path, reason);
      continue;
    }
    msg_ = std::move(m);
    std::string commands = "MAIL FROM:<" + msg_->sender + ">\r\n";
    if (pipelining_) {
      for (const std::string& r : msg_->recipients) commands += "RCPT TO:<" + r + ">\r\n";
      commands += "DATA\r\n";
    }
    c.send(commands);
    step_ = Step::mail;
    return;
  }
}

// The message's outcome. Refused recipients get one error mail; those
// refused for now stay in the file (alone, when others were served); the
// file goes once nobody is left. Until the error mail is safely queued,
// nothing is taken out of the file.
void SmtpClientSession::settle(Connection& c, bool reset) {
  std::unique_ptr<Message> m = std::move(msg_);
  if (!m->later.empty() && server_now - m->queued >= kGiveUpAfter) {
    m->refused_reason += "The message could not be delivered for 5 days. The last reason:\n" + m->later_reason;
    m->refused.insert(m->refused.end(), m->later.begin(), m->later.end());
    m->later.clear();
  }
  bool keep_all = false;
  if (!m->refused.empty()) {
    log_message("Remote SMTP server rejected article: ", m->path, logfac::smtp);
    ErrorMail sent = send_error_mail("SMTP Mail delivery failed.\n" + m->refused_reason, "", m->path);
    if (sent == ErrorMail::failed) keep_all = true;
    if (sent == ErrorMail::moved) {
      queue_drop_outgoing(m->path);
      keep_all = true;  // nothing left to settle
    }
  }
  if (!m->later.empty()) {
    auto route = client().routes.find(lower(route_));
    if (!turned_ && route != client().routes.end() && route->second.id == id_) route->second.temporary_failure = true;
    log_write(strprintf("SMTP client: %s kept for later: %s", m->path.c_str(), m->later_reason.c_str()),
              logchan::mail);
  }
  if (!keep_all) {
    if (m->later.empty()) {
      unlink(m->path.c_str());
      queue_drop_outgoing(m->path);
    } else if (m->later.size() != m->recipients.size()) {
      std::vector<std::string> still;
      for (std::size_t i : m->later) still.push_back(m->recipients[i]);
      CacheFile f = filecache_open(m->path, FileMode::read);
      int rc = EIO;
      if (f) {
        QueueEnvelope env = queue_read_envelope(f);
        rc = queue_rewrite_envelope(f, env, env.first_line, still);
        filecache_close(f);
      }
      if (rc == 0) {
        // The time it was queued still counts for giving up.
        const timespec times[2] = {{0, UTIME_OMIT}, {m->queued, 0}};
        utimensat(AT_FDCWD, m->path.c_str(), times, 0);
        if (OutgoingEntry* e = find_entry(m->path)) {
          e->recipients.clear();
          for (const std::string& s : still) e->recipients += (e->recipients.empty() ? "" : ", ") + s;
          e->size = file_size(m->path);
        }
      } else {
        log_write("SMTP client: could not rewrite " + m->path + ": " + error_text(rc), logchan::errors);
      }
    }
  }
  if (reset) {
    c.send("RSET\r\n");
    step_ = Step::rset;
  } else {
    next_message(c);
  }
}

void SmtpClientSession::on_close(Connection& c, CloseReason reason) {
  // A message in hand was not settled: its file stays as it is.
  msg_.reset();
  release_claims(id_);
  Client& cl = client();
  if (turned_) {
    --cl.turn_sessions;
    note_running();
    return;
  }
  const std::string key = lower(route_);
  auto it = cl.routes.find(key);
  if (it == cl.routes.end() || it->second.id != id_) return;
  log_message("SMTP client closing connection: ", close_reason_text(reason), logfac::house);
  if (reason == CloseReason::tls_failed) {
    // Without a password at stake, mail goes on in plain text: one new
    // connection to the same host that does not ask for TLS.
    if (target_.user.empty() && !target_.plain_only && !quit_flag) {
      log_write(strprintf("SMTP client: TLS with %s (%s) failed; trying again without it", target_.host.c_str(),
                          c.peer().text.c_str()),
                logchan::mail);
      if (connect_host(it->second, target_.host, true)) return;
    } else if (!target_.user.empty()) {
      log_write(strprintf("SMTP client: no login to %s (%s): TLS failed (is its certificate trusted and for that "
                          "name?); the password is not sent and the mail stays queued",
                          target_.host.c_str(), c.peer().text.c_str()),
                logchan::mail);
    }
    failed_ = true;
  }
  // A host that could not be reached, or would not greet: the next one.
  if (!reached_ && !failed_ && reason != CloseReason::shutdown && !quit_flag &&
      it->second.next_host < it->second.hosts.size()) {
    connect_next(key);
    return;
  }
  end_route(key, !reached_ || failed_);
}

void connect_next(const std::string& key) {
  Client& cl = client();
  auto it = cl.routes.find(key);
  if (it == cl.routes.end()) return;
  Route& r = it->second;
  while (r.next_host < r.hosts.size()) {
    const std::string host = r.hosts[r.next_host++];
    if (connect_host(r, host, false)) return;
  }
  end_route(key, true);
}

bool connect_host(Route& r, const std::string& host, bool plain_only) {
  log_message("SMTP client connecting to: ", host, logfac::house);
  Target target{host, r.user, r.password, plain_only};
  return connect_to(svc::smtp_client, host, r.port,
                    std::make_unique<SmtpClientSession>(r.name, r.id, false, std::move(target))) != nullptr;
}

void note_running() {
  const Client& cl = client();
  if (!cl.routes.empty() || cl.turn_sessions > 0) {
    status_bits |= status::smtp_client_running;
  } else if (status_bits & status::smtp_client_running) {
    status_bits &= ~status::smtp_client_running;
    status_bits |= status::smtp_client_ended;
  }
}

}  // namespace

RelayParse smtp_relay_parse(std::string_view text, SmtpRelay& relay) {
  relay = SmtpRelay{};
  std::size_t start = text.find_first_not_of(" \t,\r\n");
  if (start == std::string_view::npos) return RelayParse::none;
  text.remove_prefix(start);
  text = text.substr(0, text.find_first_of(" \t,\r\n"));
  if (std::size_t at = text.rfind('@'); at != std::string_view::npos) {
    std::string_view login = text.substr(0, at);
    std::size_t colon = login.find(':');
    if (colon == 0 || colon == std::string_view::npos) return RelayParse::bad;
    relay.user = std::string(login.substr(0, colon));
    relay.password = std::string(login.substr(colon + 1));
    text.remove_prefix(at + 1);
  }
  if (std::size_t colon = text.find(':'); colon != std::string_view::npos) {
    const int port = port_number(text.substr(colon + 1));
    if (port == 0) return RelayParse::bad;
    relay.port = static_cast<std::uint16_t>(port);
    text = text.substr(0, colon);
  }
  if (text.empty()) return RelayParse::bad;
  relay.host = std::string(text);
  return RelayParse::ok;
}

bool smtp_send_run(bool by_poll) {
  Client& cl = client();
  cl.last_run = server_now;
  if (!link_up) return false;
  std::vector<std::string> names;
  for (const OutgoingEntry& e : queue_outgoing()) {
    if (e.holder >= 0) continue;
    const std::string key = lower(e.route);
    if (cl.routes.count(key)) continue;
    if (by_poll) {
      auto wait = cl.retry_at.find(key);
      if (wait != cl.retry_at.end() && server_now < wait->second) continue;
    }
    if (std::none_of(names.begin(), names.end(), [&](const std::string& n) { return str_iequals(n, e.route); }))
      names.push_back(e.route);
  }
  bool started = false;
  for (const std::string& name : names) started |= start_route(name);
  return started;
}

void smtp_client_poll() {
  if (!link_up || config.smtp_time == 0 || queue_outgoing().empty()) return;
  const Client& cl = client();
  if (config.smtp_time == -1 ||
      (config.smtp_time > 0 && cl.routes.empty() && server_now - cl.last_run > config.smtp_time * 60))
    smtp_send_run(true);
}

int smtp_client_count() {
  const Client& cl = client();
  return static_cast<int>(cl.routes.size()) + cl.turn_sessions;
}

std::unique_ptr<Session> smtp_turn_session() {
  Client& cl = client();
  ++cl.turn_sessions;
  note_running();
  return std::make_unique<SmtpClientSession>("default", cl.next_id++, true);
}

std::unique_ptr<Session> smtp_client_session(const SmtpRelay& relay) {
  return std::make_unique<SmtpClientSession>("default", client().next_id++, false,
                                             Target{relay.host, relay.user, relay.password, false});
}

void smtp_client_reset() {
  Client& cl = client();
  for (auto& [key, r] : cl.routes)
    if (r.lookup) net_cancel_lookup(r.lookup);
  cl = Client{};
  cl.last_run = server_now;
}

void smtp_client_register() {
  service_register({
      .number = svc::smtp_client,
      .name = "smtp client",
      .timeout = &config.smtp_sock_timeout,
      .line_limit = kReplyLineLimit,
  });
  client().last_run = server_now;
  hooks.smtpkick = [] { return smtp_send_run(false); };
  hooks.smtp_client_count = smtp_client_count;
}

}  // namespace velmor
