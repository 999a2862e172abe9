// The SMTP server (service 20): greets, reads commands and message data,
// and writes each accepted message as one file of the incoming queue. A
// message is acknowledged only once its file is synced and renamed into
// place; replies never overrun the output buffer (parsing waits while the
// client does not read); overlong lines are refused without losing the
// transaction.
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
#include "core/sockets.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

namespace state {
constexpr int reply = 20;       // reply being sent, then a command
constexpr int command = 30;     // waiting for a command
constexpr int data = 40;        // receiving message data
constexpr int reply_data = 41;  // the 354 being sent, then message data
constexpr int committing = 42;  // the message waits for its group commit
}  // namespace state

constexpr std::uint32_t kIdVerify = 0x80;
// Room every command needs in the output buffer before it is parsed: the
// longest reply one command line can produce.
constexpr std::size_t kReplyRoom = 600;
constexpr std::size_t kEchoMax = 200;  // of a client's text echoed in a reply

const char* const kLocalError = "451 Requested action aborted: local error in processing\r\n";

struct SmtpSession final : SessionData {
  std::string received;  // the Received: text made at accept
  std::string trace;     // received, its date line and the X-Sender line
  CacheFile queue;       // the queue file of the transaction (its hidden name)
  std::string queue_path;  // the name it gets once committed
  std::string queue_hidden;
  std::uint64_t serial = 0;  // identifies the session to the group commit
  bool committed = false;
  int commit_error = 0;
  int denial = 0;        // 1 reject list, 2 not a local user, 3 may not send now
  std::vector<std::string> recipients;  // accepted, each once
  bool write_failed = false;
  bool skipping_line = false;  // the rest of an overlong line is discarded
  std::shared_ptr<const GroupOptions> group;
  MessageReceiver receiver;
  std::string chunk;

  ~SmtpSession() override { queue_file_discard(queue); }
  void discard() {
    queue_file_discard(queue);
    recipients.clear();
    write_failed = false;
  }
};

SmtpSession& session(SocketRecord& r) { return r.session_as<SmtpSession>(); }

// Sessions waiting for the group commit: serial -> descriptor.
std::unordered_map<std::uint64_t, int> g_waiting;
std::uint64_t g_next_serial = 1;

void reply(SocketRecord& r, std::string_view text) {
  // kReplyRoom is reserved before every command, so this always fits.
  if (!r.write_buf.append(text)) log_write("SMTP reply dropped: output buffer full", logchan::errors);
}

std::string clip(std::string_view text, std::size_t max) { return std::string(text.substr(0, max)); }

// The reply to a MAIL or RCPT argument that holds no usable address.
bool refused_path(SocketRecord& r, const EnvelopePath& path, const char* syntax) {
  if (path.result == PathResult::ok) return false;
  reply(r, path.result == PathResult::too_long ? "501 Address too long\r\n" : syntax);
  return true;
}

void cmd_mail(SocketRecord& r, SmtpSession& s, std::string_view arg) {
  EnvelopePath path = parse_envelope_path(arg, "from", true);
  if (refused_path(r, path, "501 Syntax: MAIL FROM:<address>\r\n")) return;
  std::string_view sender = path.address;
  s.discard();
  s.denial = 0;
  s.group.reset();
  if (!sender.empty() && smtp_reject_match(sender)) s.denial = 1;
  if (s.denial == 0) {
    std::optional<std::string> local = mail_local_user(sender);
    bool exists = local && user_exists(*local);
    if (exists) s.group = user_group(*local);
    if ((r.flags & kIdVerify) && local && !exists) {
      s.denial = 2;
    } else if (exists && !group_permits(s.group, "mail.smtp.send")) {
      // A local sender with no group set (no groups file) is refused too.
      s.denial = 3;
    }
  }
  if (s.denial == 0) {
    std::time_t now = server_now ? server_now : std::time(nullptr);
    s.trace = s.received + ";\r\n\t" + mail_date_text(now) + "\r\n";
    s.trace += "X-Sender: " + (sender.empty() ? std::string("Unknown") : std::string(sender)) + "\r\n";
    PendingIncoming p = queue_open_incoming_pending();
    if (!p.file) {
      reply(r, kLocalError);
      return;
    }
    s.queue = std::move(p.file);
    s.queue_path = std::move(p.path);
    s.queue_hidden = std::move(p.hidden);
    // The file holds the address as judged here, never the client's line.
    if (filecache_write(s.queue, "MAIL FROM:<" + std::string(sender) + ">\r\n") != 0) {
      s.discard();
      reply(r, kLocalError);
      return;
    }
  }
  reply(r, "250 OK Sender accepted\r\n");
}

void cmd_rcpt(SocketRecord& r, SmtpSession& s, std::string_view arg) {
  if (s.denial) {
    static const char* const why[] = {"", "SMTP Posting denied - mail from blocked site",
                                      "SMTP posting denied - sender not a valid local user",
                                      "SMTP posting denied - local user not allowed to send"};
    log_message(why[s.denial], {}, logfac::house);
    reply(r, "550 posting denied\r\n");
    return;
  }
  if (!s.queue) {
    reply(r, "503 Need MAIL before RCPT\r\n");
    return;
  }
  EnvelopePath path = parse_envelope_path(arg, "to", false);
  if (refused_path(r, path, "501 Syntax: RCPT TO:<address>\r\n")) return;
  std::string_view address = path.address;
  if (std::find(s.recipients.begin(), s.recipients.end(), address) != s.recipients.end()) {
    reply(r, "250 OK Recipient syntactically correct\r\n");  // once is enough
    return;
  }
  if (s.recipients.size() >= kMaxRecipients) {
    reply(r, "452 Too many recipients\r\n");
    return;
  }
  if (s.group && !(s.group->mail_flags & gflag::mail_override)) {
    const std::string& block = s.group->text("mail.address.send.block");
    const std::string& allow = s.group->text("mail.address.send.allow");
    if (!block.empty() && wildcard_match(address, block) && !(!allow.empty() && wildcard_match(address, allow))) {
      reply(r, "550 Posting to this address forbidden\r\n");
      return;
    }
  }
  // No relaying for strangers: outside recipients only from our own network.
  if (!mail_local_user(address) && !relay_permitted(r.peer_ip, config.smtp_allow)) {
    reply(r, "550 Posting to this address forbidden\r\n");
    return;
  }
  if (filecache_write(s.queue, "RCPT TO:<" + std::string(address) + ">\r\n") != 0) {
    s.discard();
    reply(r, kLocalError);
    return;
  }
  s.recipients.emplace_back(address);
  reply(r, "250 OK Recipient syntactically correct\r\n");
}

void cmd_data(SocketRecord& r, SmtpSession& s) {
  if (!s.queue) {
    reply(r, "503 Need MAIL before DATA\r\n");
    return;
  }
  if (s.recipients.empty()) {
    reply(r, "503 Need RCPT before DATA\r\n");
    return;
  }
  if (filecache_write(s.queue, "DATA\r\n" + s.trace) != 0) {
    s.discard();
    reply(r, kLocalError);
    return;
  }
  s.receiver = MessageReceiver{};
  s.receiver.now = server_now;
  reply(r, "354 Start mail input; end with <CRLF>.<CRLF>\r\n");
  r.state = state::reply_data;
}

void cmd_vrfy(SocketRecord& r, std::string_view arg) {
  const UserRecord* u = user_find(trim_blanks(arg.substr(0, 128)));
  if (!u) {
    reply(r, "550 Unknown user (Server only checks mailbox/login names)\r\n");
    return;
  }
  reply(r, strprintf("250 %s <%s@%s>\r\n", clip(u->full_name, kEchoMax).c_str(), clip(u->login, kEchoMax).c_str(),
                     mail_primary_domain().c_str()));
}

// One command line (without its line end).
void command(SocketRecord& r, SmtpSession& s, std::string_view line) {
  std::size_t verb_end = std::min(line.find(' '), line.size());
  std::string_view verb = line.substr(0, std::min<std::size_t>(verb_end, 10));
  std::string_view arg = line.substr(std::min(verb.size() + 1, line.size()));
  r.state = state::reply;
  log_write(strprintf("%d - %s", r.fd, clip(line, 254).c_str()), logchan::mail);
  if (verb.size() > 8) reply(r, "500 Bad command - too long\r\n");
  if (verb.empty()) return;
  if (str_iequals(verb, "helo")) {
    reply(r, "250 Hello " + clip(arg, kEchoMax) + ", how's life?\r\n");
  } else if (str_iequals(verb, "mail")) {
    cmd_mail(r, s, arg);
  } else if (str_iequals(verb, "rcpt")) {
    cmd_rcpt(r, s, arg);
  } else if (str_iequals(verb, "data")) {
    cmd_data(r, s);
  } else if (str_iequals(verb, "rset")) {
    s.discard();
    reply(r, "250 Reset OK\r\n");
  } else if (str_iequals(verb, "noop")) {
    reply(r, "250 OK\r\n");
  } else if (str_iequals(verb, "quit")) {
    log_message("SMTP server closing connection", {}, logfac::house);
    reply(r, strprintf("221 %s Velmor SMTP Server (%s) closing connection at %s\r\n",
                       text_of(config.server_name).c_str(), kVersion, time_text(std::time(nullptr)).c_str()));
    r.state = sockstate::closing;
  } else if (str_iequals(verb, "vrfy")) {
    cmd_vrfy(r, arg);
  } else if (str_iequals(verb, "turn")) {
    // Reversing the connection needs the outgoing client role, which this
    // server does not offer; no peer can take our queue this way.
    reply(r, "502 TURN not available\r\n");
  } else {
    reply(r, "500 Unknown command:" + std::string(verb) + "\r\n");
  }
}

void commands(SocketRecord& r, SmtpSession& s) {
  while (!r.read_buf.empty() && (r.state == state::reply || r.state == state::command)) {
    if (r.write_buf.room() < kReplyRoom) return;  // resumed once the client reads
    std::string_view input = r.read_buf.view();
    std::size_t end = input.find_first_of("\r\n");
    if (end == std::string_view::npos) {
      if (input.size() <= kMaxCommandLine && r.read_buf.room() > 0) return;  // the rest is still coming
      // Over the limit and no line end yet: refuse the line, keep the session.
      if (!s.skipping_line) reply(r, "500 Line too long\r\n");
      s.skipping_line = true;
      r.read_buf.clear();
      r.state = state::reply;
      return;
    }
    std::string_view line = input.substr(0, end);
    std::size_t next = end;
    while (next < input.size() && (input[next] == '\r' || input[next] == '\n')) ++next;
    if (s.skipping_line) {
      s.skipping_line = false;
    } else if (line.size() > kMaxCommandLine) {
      // Never acted on in part: what is judged is what gets stored.
      reply(r, "500 Line too long\r\n");
      r.state = state::reply;
    } else {
      command(r, s, line);
    }
    r.read_buf.consume(next);
  }
  if (r.state == sockstate::closing) r.read_buf.clear();
}

// The whole message is in: it is flushed now and committed with every other
// message finished in this pass; the reply waits for that commit.
void finish_message(SocketRecord& r, SmtpSession& s) {
  int rc = s.write_failed ? EIO : filecache_purge(s.queue);
  if (rc != 0) {
    log_write("SMTP: message not queued, the queue file could not be written: " + s.queue_path, logchan::errors);
    unlink(s.queue_hidden.c_str());
    s.discard();
    reply(r, kLocalError);
    r.state = state::reply;
    return;
  }
  s.serial = g_next_serial++;
  g_waiting[s.serial] = r.fd;
  queue_commit_later(s.queue_path, s.queue_hidden, static_cast<int>(s.serial));
  s.committed = false;
  r.state = state::committing;
  r.want_write = true;  // the write handler runs the commit in the next pass
}

void commit_done(int owner, int error) {
  auto it = g_waiting.find(static_cast<std::uint64_t>(owner));
  if (it == g_waiting.end()) return;
  SocketRecord* r = record_for(it->second);
  g_waiting.erase(it);
  if (!r || r->closed || r->service != svc::smtp || !r->session) return;
  SmtpSession& s = session(*r);
  if (s.serial != static_cast<std::uint64_t>(owner)) return;
  s.committed = true;
  s.commit_error = error;
}

// Tells the client how its commit went.
void commit_reply(SocketRecord& r, SmtpSession& s) {
  reply(r, s.commit_error == 0 ? "250 OK\r\n" : kLocalError);
  s.committed = false;
  s.recipients.clear();
  r.want_write = false;
  r.state = state::reply;
}

void data_phase(SocketRecord& r, SmtpSession& s) {
  s.chunk.clear();
  std::string headers;
  std::size_t used = s.receiver.feed(r.read_buf.view(), false, s.chunk, &headers);
  if (used == 0 && r.read_buf.room() < 64)
    used = s.receiver.feed(r.read_buf.view(), true, s.chunk, &headers);
  r.read_buf.consume(used);
  if (!headers.empty()) log_header_summary(r.fd, headers);
  if (!s.write_failed && !s.chunk.empty() && filecache_write(s.queue, s.chunk) != 0) s.write_failed = true;
  if (s.receiver.done()) finish_message(r, s);
}

int process(SocketRecord& r) {
  SmtpSession& s = session(r);
  if (r.state == state::data) {
    data_phase(r, s);
    if (r.state == state::data) return 0;
  }
  if (r.state == state::reply || r.state == state::command) commands(r, s);
  return 0;
}

int smtp_accept(SocketRecord& r) {
  r.flags = 0;
  if (!address_list_match(config.smtp_allow, r.peer_ip)) {
    if (address_list_match(config.smtp_block, r.peer_ip)) {
      socket_send(r, "421 " + text_of(config.server_name) + " connection refused\r\n");
      return 1;
    }
    if (address_list_match(config.smtp_auth, r.peer_ip)) r.flags |= kIdVerify;
  }
  auto s = std::make_unique<SmtpSession>();
  const std::string& name = text_of(config.server_name);
  reply(r, strprintf("220 %s Velmor Server Suite SMTP Server %s (v%s %s) ready at %s - Report problems to %s\r\n",
                     name.c_str(), (r.flags & kIdVerify) ? "[ID verify]" : "", kVersion, kPlatform,
                     time_text(std::time(nullptr)).c_str(), text_of(config.admin_email).c_str()));
  r.state = state::reply;
  log_write(strprintf("%d - SMTP Connect from %s", r.fd, r.peer_addr.c_str()), logchan::mail);
  s->received = strprintf("Received: from %s\r\n\tby %s with SMTP (Velmor Server Suite v%s %s)",
                          r.peer_addr.c_str(), name.c_str(), kVersion, kPlatform);
  log_message("SMTP Server accepting connection from:", r.peer_addr, logfac::house);
  r.session = std::move(s);
  return 0;
}

int smtp_read(SocketRecord& r, long) {
  mail_note_traffic();
  return process(r);
}

int smtp_write(SocketRecord& r) {
  if (r.state == state::committing) {
    SmtpSession& s = session(r);
    if (!s.committed && queue_commit_pending()) queue_commit(commit_done);
    if (!s.committed) return 0;
    commit_reply(r, s);
  }
  if (!r.write_buf.empty() && socket_send(r) < 0) return 1;
  if (r.write_buf.empty()) {
    if (r.state == sockstate::closing) return 1;
    if (r.state == state::reply) r.state = state::command;
    if (r.state == state::reply_data) r.state = state::data;
  }
  // Input held back while the output was full, or sent behind DATA.
  if (!r.read_buf.empty()) return process(r);
  return 0;
}

void smtp_release(SocketRecord& r) {
  if (!r.session) return;
  SmtpSession& s = session(r);
  // A message waiting for its commit is still committed (it was received
  // whole), but nobody waits for the answer.
  if (s.serial) g_waiting.erase(s.serial);
  s.discard();
}

}  // namespace

void smtp_server_register() {
  ServiceHandlers h;
  h.accept = smtp_accept;
  h.read = smtp_read;
  h.write = smtp_write;
  h.release = smtp_release;
  register_service(svc::smtp, std::move(h));
}

}  // namespace velmor
