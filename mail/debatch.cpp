// Debatching: one incoming file is checked against the sender's group
// limits, every recipient is resolved through the alias table, local
// recipients get the message in their mailbox and outside ones a file of the
// outgoing queue (fetched mail excepted: it reaches local mailboxes only,
// and a fetched message nobody local receives goes to oddments). The
// recipients of a file are handled one per step, and the
// poll works for a bounded time, so a message for many never holds up the
// connections. Each mailbox and each outside address gets one copy however
// often it is named. The incoming file is deleted only when every copy made
// of it is safely on disk; after a temporary failure it stays for a later
// try, holding only the recipients still to do; anything else sends it to
// the oddments folder with its reason.
#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <ctime>
#include <deque>
#include <memory>
#include <set>

#include "core/background.h"
#include "core/config.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/alias.h"
#include "mail/delivery.h"
#include "mail/mailbox.h"
#include "mail/pop_client.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"
#include "mail/recipient.h"
#include "mail/smtp_client.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

using Clock = std::chrono::steady_clock;

std::time_t g_last_traffic = 0;
std::time_t g_retry_at = 0;  // rescan for files left after a temporary failure
std::set<std::string> g_waiting_retry;  // those files, until the rescan lists them again
bool g_debatch_pending = false;

// A message that has passed this many relays is looping.
constexpr int kMaxReceived = 30;
// How long one slice may debatch before the connections are served again.
// While files wait, slices follow each other with a dispatcher pass in
// between, so a burst drains at full speed and a client waits for one slice
// at most.
constexpr auto kDebatchSlice = std::chrono::milliseconds(10);
// How long the overviews' upkeep may run in one go.
constexpr auto kUpkeepSlice = std::chrono::milliseconds(4);

class Debatch final : public QueueSink {
 public:
  Debatch(std::string path, CacheFile file) : path_(std::move(path)), file_(std::move(file)) {}
  ~Debatch() override {
    if (outgoing_) filecache_destroy(outgoing_);
  }

  const std::string path_;
  CacheFile file_;
  QueueEnvelope env_;
  std::size_t next = 0;     // the envelope recipient to handle next

  int copies = 0;           // copies safely made (mailboxes, files, error mails)
  std::string failure;      // the first reason the file cannot simply be deleted
  bool only_temporary = true;
  bool moved = false;       // an error mail moved the file to oddments
  std::string trace;        // the mail-log record
  // Recipients to try again later (each as an envelope address that leads
  // to the same mailbox or outside address again).
  std::vector<std::string> retry;

  bool more() const { return !moved && next < env_.recipients.size(); }
  // False for an envelope recipient named before (in any case).
  bool first_mention(std::string_view address) { return named_.insert(str_lower(address)).second; }

  void fail(std::string reason, bool temporary = false) {
    if (failure.empty()) failure = std::move(reason);
    if (!temporary) only_temporary = false;
  }

  // An error mail about this message; its outcome counts like any copy.
  void error(std::string_view text, std::string_view to, bool headers_only = false) {
    switch (send_error_mail(text, to, path_, headers_only)) {
      case ErrorMail::sent: ++copies; break;
      case ErrorMail::skipped: break;
      case ErrorMail::moved: moved = true; break;
      case ErrorMail::failed: fail("Error mail could not be written"); break;
    }
  }

  std::string redirect_or_sender(std::string_view key) const {
    if (sender_group && sender_group->has(key) && !sender_group->text(key).empty())
      return sender_group->text(key);
    return {};  // empty: send_error_mail uses the file's sender
  }

  // ---- AliasSink ----
  // A local copy is queued here and written by run_deliveries(), a piece
  // at a time; it counts once its mailbox's commit has synced it.
  bool deliver_local(std::string_view user, std::string_view to_address) override {
    if (moved) return true;
    std::string recipient(to_address.empty() ? user : to_address);
    // One copy per mailbox, however many names lead there.
    std::string box = str_lower(user) + "/" + mailbox_box_for_address(recipient);
    if (mailboxes_.count(box)) return true;
    if (!mailbox_recipient_known(recipient)) return false;
    mailboxes_.insert(box);
    // The queue file is read once for all its local recipients.
    if (!message_) message_ = std::make_shared<QueuedMessage>(path_);
    std::string who(user);
    deliveries_.push_back({LocalDelivery(message_, recipient, env_.sender,
                                         [this, recipient, who](int error) { committed(recipient, who, error); }),
                           recipient, who});
    return true;
  }

  // Works on the queued local copies until `deadline`, one piece at least.
  // True when none is left unfinished.
  bool run_deliveries(Clock::time_point deadline) {
    while (!deliveries_.empty()) {
      if (moved) {
        deliveries_.clear();
        return true;
      }
      Pending& p = deliveries_.front();
      LocalOutcome o = p.delivery.step(deadline);
      if (o == LocalOutcome::working) return false;
      // Delivery may have moved the file aside (a mailbox it cannot open).
      if (file_size(path_) < 0) moved = true;
      if (o == LocalOutcome::handled) {
        ++copies;
      } else if (o == LocalOutcome::temporary) {
        temporary(p.recipient, p.user);
      } else {
        ++awaiting;
      }
      deliveries_.pop_front();
      if (Clock::now() >= deadline && !deliveries_.empty()) return false;
    }
    return true;
  }

  int awaiting = 0;  // local copies written, waiting for their commit

  void deliver_remote(std::string_view address) override {
    if (moved || !remote_.emplace(address).second) return;
    if (env_.fetched) {
      // Fetched mail is the site's own, collected from its providers: sent
      // out again it would go back where it came from, and come back.
      log_message("Fetched mail not sent on to ", address, logfac::maildebatch);
      return;
    }
    std::string_view domain = address_domain(address);
    if (!domain.empty() && config.smtp_direct && wildcard_match(domain, *config.smtp_direct)) {
      send_direct(address);
      return;
    }
    if (!outgoing_) {
      std::string name = queue_new_outgoing_name();
      if (!name.empty()) outgoing_ = filecache_open(name, FileMode::write);
      if (!outgoing_) {
        log_write("Mail add RCPT TO: Couldn't open outgoing mail file", logchan::errors);
        fail("Outgoing mail file could not be created", true);
        retry.emplace_back(address);
        return;
      }
      write_out(outgoing_, "MAIL FROM:<" + outgoing_sender() + ">\r\n");
    }
    write_out(outgoing_, "RCPT TO:<" + std::string(address) + ">\r\n");
    outgoing_rcpts_.emplace_back(address);
  }

  bool deliver_file(std::string_view target) override {
    if (moved) return true;
    CacheFile archive = filecache_open(std::string(target), FileMode::append);
    int rc = archive ? filecache_copy(file_, env_.body_offset, archive, kToEnd) : 1;
    if (rc == 0) rc = filecache_sync(archive);
    int close_rc = archive ? filecache_close(archive) : 0;
    if (rc != 0 || close_rc != 0) {
      log_write(strprintf("Mail alias: can't append to %.*s", static_cast<int>(target.size()), target.data()),
                logchan::errors);
      fail("Archive file could not be written");
      return false;
    }
    ++copies;
    mail_log(strprintf("Archived: %s appended to %.*s (%llu bytes)", path_.c_str(), static_cast<int>(target.size()),
                       target.data(), static_cast<unsigned long long>(filecache_length(file_))));
    return true;
  }

  bool deliver_group(int number) override {
    if (!may_mail_group()) {
      error(strprintf("You do not have the permission to email group %d\r\n", number), {});
      return false;
    }
    for (const UserRecord* u : user_list())
      if (u->group == number) deliver_local(u->login, u->login);
    return true;
  }

  void loop_report() override {
    error("Aliasing loop whilst processing the following article\r\n", admin_address());
  }

  void temporary(const std::string& recipient, std::string_view user) {
    fail(strprintf("Temporary failure delivering to `%.*s'", static_cast<int>(user.size()), user.data()), true);
    retry.push_back(recipient);
  }

  void committed(const std::string& recipient, const std::string& user, int error) {
    --awaiting;
    if (error == 0) {
      ++copies;
    } else {
      temporary(recipient, user);
    }
  }

  // ---- the outgoing file ----
  // Writes the message (from the DATA line) behind the envelope, syncs it and
  // puts it in the outgoing list. When it cannot be written, its recipients
  // are tried again later.
  void finish_outgoing() {
    if (!outgoing_) return;
    if (moved) {
      filecache_destroy(outgoing_);
      return;
    }
    std::string rcpts;
    for (const std::string& r : outgoing_rcpts_) rcpts += (rcpts.empty() ? "" : ", ") + r;
    if (!commit_outgoing(outgoing_, !write_failed_, rcpts))
      retry.insert(retry.end(), outgoing_rcpts_.begin(), outgoing_rcpts_.end());
  }

 private:
  // A forced sender never replaces the null sender: an error mail must not
  // be answered by another.
  std::string outgoing_sender() const {
    if (!env_.sender.empty() && config.mail_from_force && !config.mail_from_force->empty())
      return *config.mail_from_force;
    return env_.sender;
  }

  void write_out(CacheFile& f, std::string_view text) {
    if (filecache_write(f, text) != 0) write_failed_ = true;
  }

  void send_direct(std::string_view address) {
    if (!env_.has_sender_bracket) {
      error("Invalid address", {});
      return;
    }
    std::string name = queue_new_outgoing_name();
    CacheFile out = name.empty() ? CacheFile() : filecache_open(name, FileMode::write);
    if (!out) {
      error("Outgoing file could not be created.\r\nThis is either due to a system error, or the outgoing queue is "
            "full.\r\nPlease try resending later.\r\n",
            {});
      return;
    }
    int rc = filecache_write(out, "MAIL FROM:<" + outgoing_sender() + ">\r\nRCPT TO:<" + std::string(address) + ">\r\n");
    if (!commit_outgoing(out, rc == 0, address)) retry.emplace_back(address);
  }

  // Copies the message (from its DATA line) behind an outgoing envelope,
  // syncs the file into place and lists it; a failure is temporary (the
  // disk may be full) and false.
  bool commit_outgoing(CacheFile& out, bool ok, std::string_view recipients) {
    if (ok && filecache_copy(file_, env_.data_offset, out, kToEnd) != 0) ok = false;
    std::string name = filecache_path(out);
    if (!ok) filecache_destroy(out);
    if (!ok || filecache_close(out) != 0) {
      fail("Outgoing mail file could not be written", true);
      return false;
    }
    ++copies;
    queue_add_outgoing(name);
    mail_log(strprintf("Queued to send: %.*s in %s (%llu bytes)", static_cast<int>(recipients.size()),
                       recipients.data(), name.c_str(), static_cast<unsigned long long>(file_size(name))));
    return true;
  }

  struct Pending {
    LocalDelivery delivery;
    std::string recipient, user;
  };
  std::shared_ptr<QueuedMessage> message_;
  std::deque<Pending> deliveries_;
  CacheFile outgoing_;
  std::vector<std::string> outgoing_rcpts_;
  bool write_failed_ = false;
  std::set<std::string> mailboxes_;  // "user/box" of every copy made or tried
  std::set<std::string> remote_;     // outside addresses already sent to
  std::set<std::string> named_;      // envelope recipients seen (lower case)
};

// Received lines of the header (the start of each line is enough).
int count_received(CacheFile& file, std::uint64_t offset) {
  CacheSource in(file);
  int count = 0;
  std::string line;
  while (count <= kMaxReceived && queue_read_line(in, offset, line, 64) != LineRead::end) {
    if (line.empty() || line == ".") break;
    if (str_istarts_with(line, "Received:")) ++count;
  }
  return count;
}

// The first word of a header value that holds an '@', without its brackets.
std::string first_address(std::string_view value) {
  std::size_t pos = 0;
  while (pos < value.size()) {
    std::size_t start = value.find_first_not_of(" \t,<>()\"';:", pos);
    if (start == std::string_view::npos) break;
    std::size_t end = value.find_first_of(" \t,<>()\"';:", start);
    std::string_view word = value.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start);
    // A word too long to be an address is not guessed at.
    if (word.find('@') != std::string_view::npos) return word.size() <= kMaxAddress ? std::string(word) : "";
    if (end == std::string_view::npos) break;
    pos = end;
  }
  return {};
}

// The sender's group limits on the whole message. True when the message was
// refused (and the refusal reported).
bool refused_by_group(Debatch& d, const GroupOptions& group, std::string_view who, std::uint64_t size) {
  if (group.mail_flags & gflag::mail_override) return false;
  std::uint32_t limit = group.size("mail.msg.size");
  if (limit && size > limit) {
    log_write(strprintf("[Mail] Oversize article [%s]:%.*s", size_text(size).c_str(), static_cast<int>(who.size()),
                        who.data()),
              logchan::filter);
    std::string to = group.has("mail.large.redirect") ? group.text("mail.large.redirect") : std::string();
    d.error(strprintf("The following email was greater than the %ukB length limit, at %llukB\r\n", limit / 1024,
                      static_cast<unsigned long long>(size / 1024)),
            to, true);
    return true;
  }
  const std::string& filter = group.text("mail.filter");
  if (!filter.empty() && mail_filter_match(filter, d.path_)) {
    log_write(strprintf("[Mail] Banned word/phrase found: %.*s", static_cast<int>(who.size()), who.data()),
              logchan::filter);
    std::string to = group.has("mail.filter.redirect") ? group.text("mail.filter.redirect") : std::string();
    d.error("The following email contained a forbidden phrase\r\n\r\n", to, true);
    return true;
  }
  return false;
}

// Fetched messages are delivered by the address in one of the pop.headers
// header lines, when one is present. True when that delivered it.
bool pop_header_filter(Debatch& d) {
  std::string list = str_lower(text_of(config.pop_headers));
  log_message("filtering:", list, logfac::maildebatch);
  if (!d.env_.has_data) {
    log_message("filtering:bad file, no DATA", {}, logfac::maildebatch);
    return false;
  }
  std::size_t pos = 0;
  while (pos < list.size()) {
    std::size_t start = list.find_first_not_of(" \t,", pos);
    if (start == std::string::npos) break;
    std::size_t end = list.find_first_of(" \t,", start);
    std::string name = list.substr(start, std::min<std::size_t>(end == std::string::npos ? list.size() - start
                                                                                         : end - start,
                                                                60));
    pos = end == std::string::npos ? list.size() : end;
    std::uint64_t offset = d.env_.body_offset;
    std::string line;
    CacheSource in(d.file_);
    for (LineRead got; (got = queue_read_line(in, offset, line, kHeaderLineKeep)) != LineRead::end;) {
      if (line.empty()) break;
      if (got == LineRead::cut) continue;  // no address is taken from part of a line
      std::size_t colon = line.find(':');
      if (colon == std::string::npos || str_lower(trim_blanks(std::string_view(line).substr(0, colon))) != name)
        continue;
      std::string address = first_address(std::string_view(line).substr(colon + 1));
      if (address.empty()) return false;
      d.trace += " " + address;
      std::optional<std::string> user = mail_local_user(address);
      if (user) {
        std::shared_ptr<const GroupOptions> group = user_group(*user);
        if (group && refused_by_group(d, *group, *user, filecache_length(d.file_))) return true;
      }
      bool taken = alias_resolve(alias_table(), user ? *user : address, d);
      if (!taken && user && user_exists(*user)) taken = d.deliver_local(*user, address);
      return taken;
    }
  }
  return false;
}

// Opens an incoming file and runs the checks on the whole message. Nothing
// when the file was dealt with at once (moved aside, refused, gone).
std::unique_ptr<Debatch> debatch_start(const std::string& path) {
  CacheFile file = filecache_open(path, FileMode::read);
  if (!file) {
    if (file_size(path) >= 0) mail_move_to_oddments(path, "Mail debatch - Bad rewrite open");
    return nullptr;
  }
  auto d = std::make_unique<Debatch>(path, std::move(file));
  auto to_oddments = [&](std::string_view reason) {
    filecache_close(d->file_);
    mail_move_to_oddments(path, reason);
    return nullptr;
  };
  std::uint64_t size = filecache_length(d->file_);
  if (size < 30) return to_oddments("Article was too short");
  d->env_ = queue_read_envelope(d->file_);
  const QueueEnvelope& env = d->env_;
  if (env.damaged) return to_oddments("Bad envelope - a line or an address is too long");
  if (env.recipients.empty() && !env.has_data && env.data_offset == 0)
    return to_oddments("Bad debatch read - unexpected end of file");
  if (env.recipients.empty()) return to_oddments("No recipients");
  if (!env.has_data || filecache_at_end(d->file_, env.body_offset))
    return to_oddments("Bad read in debatch - no message body");
  if (count_received(d->file_, env.body_offset) > kMaxReceived)
    return to_oddments("Too many Received headers - mail loop");

  if (env.fetched) {
    log_message("Article was POPed", {}, logfac::house);
  } else {
    std::optional<std::string> user = mail_local_user(env.sender);
    d->set_sender(env.sender);
    if (d->sender_group && refused_by_group(*d, *d->sender_group, user ? *user : env.sender, size)) {
      filecache_close(d->file_);
      if (d->moved) return nullptr;
      if (d->failure.empty()) {
        filecache_delete(path);
      } else {
        mail_move_to_oddments(path, d->failure);
      }
      return nullptr;
    }
  }
  // Stamped like every other mail-log line (the SMTP lines share the file).
  d->trace = strprintf("%llu <%s>", static_cast<unsigned long long>(size), env.sender.c_str());
  return d;
}

// Handles the next envelope recipient. False when none was left.
bool debatch_recipient(Debatch& d) {
  if (!d.more()) return false;
  std::size_t index = d.next++;
  const std::string& address = d.env_.recipients[index];
  if (!d.first_mention(address)) return true;
  if (!d.env_.fetched) d.trace += " " + address;
  bool override = d.sender_group && (d.sender_group->mail_flags & gflag::mail_override);
  if (d.sender_local && d.sender_group && !override) {
    const std::string& block = d.sender_group->text("mail.address.send.block");
    const std::string& allow = d.sender_group->text("mail.address.send.allow");
    if (!block.empty() && wildcard_match(address, block) && !(!allow.empty() && wildcard_match(address, allow))) {
      log_write("[Mail] Blocked recipient [" + address + "] for: " + d.env_.sender, logchan::filter);
      std::string redirect = d.redirect_or_sender("mail.block.redirect");
      log_message("Recipient address forbidden, mail redirect to ", redirect.empty() ? d.env_.sender : redirect,
                  logfac::house);
      d.error("The following email was sent to a forbidden user\r\n", redirect);
      return true;
    }
  }
  if (d.env_.fetched && index == 0 && pop_header_filter(d)) {
    d.next = d.env_.recipients.size();  // the header named the recipient
    return true;
  }
  RecipientResult to = route_recipient(address, d);
  if (to.route == RecipientRoute::unknown_user) {
    // A fetched message's sender is the site's own account at a provider:
    // nobody there is told; unless delivered, it goes to oddments.
    if (!d.env_.fetched) d.error(strprintf("Local user %s does not exist\r\n", to.local.c_str()), {});
  } else if (to.route == RecipientRoute::no_administrator) {
    // Kept for the operator rather than bounced: postmaster must reach someone.
    log_write("Mail debatch: postmaster mail has nobody to go to (no postmaster alias, and admin.email names no user)",
              logchan::errors);
    d.fail("No administrator for postmaster mail - set a postmaster alias or admin.email");
  }
  return true;
}

// Settles the file by its outcome: deleted when every copy is made, kept
// for a later try after a temporary failure (cut down to the recipients
// still to do), otherwise moved to oddments.
void debatch_finish(Debatch& d) {
  if (d.awaiting) mailbox_commit_staged();  // nothing is settled before its copies are
  d.finish_outgoing();
  log_write(d.trace, logchan::mail_trace);
  const std::string& path = d.path_;
  if (d.moved) {
    filecache_close(d.file_);
  } else if (d.failure.empty() && d.env_.fetched && d.copies == 0) {
    filecache_close(d.file_);
    mail_move_to_oddments(path, "Fetched mail for no local user");
  } else if (d.failure.empty()) {
    filecache_close(d.file_);
    filecache_delete(path);
  } else if (!d.only_temporary) {
    filecache_close(d.file_);
    mail_move_to_oddments(path, d.failure);
  } else {
    // Something was done: the file keeps only the recipients left. Should
    // that fail (or an address not fit an envelope line), the whole file is
    // tried again, and those done get it twice rather than anyone never.
    if (d.copies > 0) {
      // A fetched message keeps no "POP3" mark: its header has been read.
      std::string first = d.env_.fetched ? "MAIL FROM:<" + d.env_.sender + ">" : d.env_.first_line;
      int rc = std::all_of(d.retry.begin(), d.retry.end(), envelope_address_fits)
                   ? queue_rewrite_envelope(d.file_, d.env_, first, d.retry)
                   : EINVAL;
      if (rc != 0)
        log_write(strprintf("Mail debatch: %s not cut down to the recipients left (%s); those done may get it again",
                            path.c_str(), error_text(rc).c_str()),
                  logchan::errors);
    }
    filecache_close(d.file_);
    log_write("Mail debatch: " + d.failure + " - " + path + " left in the queue for a later try", logchan::errors);
    mail_log("Kept for a later try: " + path + ": " + d.failure);
    g_waiting_retry.insert(path);
    queue_retry_later();
  }
}

std::unique_ptr<Debatch> g_job;                // the file in hand
std::vector<std::unique_ptr<Debatch>> g_parked;  // files done, their local copies waiting for the commit

// Commits every local copy written so far (one sync of each mailbox and one
// of its overview), then settles the files that waited for it.
void debatch_settle() {
  mailbox_commit_staged();
  std::vector<std::unique_ptr<Debatch>> parked;
  parked.swap(g_parked);
  for (auto& job : parked) debatch_finish(*job);
}

bool g_commit_due = false;  // a slice wrote local copies; its commit runs in the next pass
BackgroundWork g_mail_work;  // debatch slices and mailbox upkeep between passes

DebatchStep step_in_slice(Clock::time_point deadline, bool settle);

// Debatches until `deadline`; with `one_file`, stops at the end of a file.
// What was written is committed before it returns, or with `commit_later`
// in the next call of mail_background(), so that a client waits for the
// slice or for the syncs, never for both.
void debatch_for(Clock::time_point deadline, bool one_file, bool commit_later = false) {
  for (;;) {
    DebatchStep step = step_in_slice(deadline, false);
    bool more = g_job || !queue_incoming().empty();
    if (step != DebatchStep::finished || one_file || !more || Clock::now() >= deadline) break;
  }
  if (commit_later) {
    g_commit_due = true;
  } else {
    debatch_settle();
  }
  g_debatch_pending = g_job || !queue_incoming().empty();
}

// One step; with `settle`, a file ended when the deadline has passed (or
// the last one) is committed and settled at once, else it waits in g_parked.
DebatchStep step_in_slice(Clock::time_point deadline, bool settle) {
  if (!g_job) {
    std::size_t left = queue_incoming().size();
    std::optional<std::string> path = queue_pop_incoming();
    if (!path) {
      if (settle) debatch_settle();
      log_message("Debatching mail - no articles in queue", {}, logfac::house);
      return DebatchStep::idle;
    }
    log_message("Debatching mail - articles left in queue: ", std::to_string(left), logfac::house);
    g_job = debatch_start(*path);
    if (!g_job) return DebatchStep::finished;
  }
  // One recipient at least, then the connections get their turn.
  bool stepped = false;
  for (;;) {
    if (!g_job->run_deliveries(deadline)) return DebatchStep::working;
    if (!g_job->more()) break;
    if (stepped && Clock::now() >= deadline) return DebatchStep::working;
    debatch_recipient(*g_job);
    stepped = true;
  }
  // The file waits for the commit of its local copies; files that follow in
  // the same slice share it.
  g_parked.push_back(std::move(g_job));
  if (settle && (Clock::now() >= deadline || queue_incoming().empty())) debatch_settle();
  return DebatchStep::finished;
}

}  // namespace

DebatchStep debatch_step(Clock::time_point deadline) { return step_in_slice(deadline, true); }

void debatch_file(const std::string& path) {
  std::unique_ptr<Debatch> d = debatch_start(path);
  if (!d) return;
  while (debatch_recipient(*d)) {
  }
  d->run_deliveries(Clock::time_point::max());
  mailbox_commit_staged();
  debatch_finish(*d);
}

// ---- start-up and the poll ------------------------------------------------

void mail_note_traffic() { g_last_traffic = server_now; }
void queue_retry_later() { g_retry_at = server_now + kRetrySeconds; }

int mail_init() {
  std::time_t now = server_now ? server_now : std::time(nullptr);
  queue_init(now);
  g_last_traffic = now;
  g_retry_at = 0;
  g_waiting_retry.clear();
  g_debatch_pending = false;
  log_message("    Loading mail alias entries", {}, logfac::house);
  alias_load();
  log_message("    Loading SMTP reject entries", {}, logfac::house);
  smtp_reject_load();
  log_message("    Scanning incoming mail queue", {}, logfac::house);
  queue_scan_incoming();
  log_message("    Scanning outgoing mail queue", {}, logfac::house);
  queue_scan_outgoing();

  hooks.mailrescan = [] {
    queue_scan_outgoing();
    g_waiting_retry.clear();  // listed again
    queue_scan_incoming();
  };
  hooks.maildebatch = [] { mail_debatch_one(); };
  g_mail_work = BackgroundWork("mail", mail_background);
  hooks.list_mail_queue = queue_list;
  hooks.outgoing_mail_count = [] { return queue_outgoing().size(); };
  hooks.incoming_mail_count = [] {
    std::size_t retry = g_waiting_retry.size();
    return std::pair<std::size_t, std::size_t>{queue_incoming().size() + (g_job ? 1 : 0) + g_parked.size() + retry,
                                               retry};
  };
  return 0;
}

void mail_debatch_one() { debatch_for(Clock::now() + kDebatchSlice, true); }

void mail_poll() {
  if (g_retry_at && server_now >= g_retry_at) {
    g_retry_at = 0;
    g_waiting_retry.clear();
    queue_scan_incoming();
  }
  if (!queue_incoming().empty() && config.mail_debatch_time > 0 &&
      server_now - g_last_traffic > config.mail_debatch_time)
    g_debatch_pending = true;
  // A slice per poll, bounded in time; while files wait, mail_background()
  // goes on between the dispatcher's passes.
  if (g_debatch_pending) debatch_for(Clock::now() + kDebatchSlice, false);
  smtp_client_poll();
  mailbox_upkeep(Clock::now() + kUpkeepSlice);
  pop_client_poll();  // the timed fetch, while the link is up
}

bool mail_background() {
  if (quit_flag) {
    // The suite stops: what was written is committed, and a message half
    // written is taken back out of its mailbox (its file stays queued).
    g_commit_due = false;
    debatch_settle();
    g_job.reset();
    return false;
  }
  if (g_commit_due) {
    g_commit_due = false;
    debatch_settle();
    return true;
  }
  if (!g_debatch_pending && !mailbox_upkeep_running()) return false;
  if (g_debatch_pending) debatch_for(Clock::now() + kDebatchSlice, false, true);
  bool more = mailbox_upkeep_running() && mailbox_upkeep(Clock::now() + kUpkeepSlice);
  return g_debatch_pending || more;
}

}  // namespace velmor
