// Local delivery: a queued message appended to a user's mailbox, after the
// receive checks of the user's group and the user's own forward and
// vacation settings.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <optional>
#include <unordered_map>
#include <vector>

#include "core/filecache.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/safedir.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "mail/delivery.h"
#include "mail/imap_address.h"
#include "mail/mailbox.h"
#include "mail/mailfile.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

constexpr std::time_t kVacationInterval = 7 * 24 * 3600;
constexpr int kMaxForwardHops = 10;
// New boxes made by sub-address, per user and day: a sender cannot make a
// user's mail folder grow by a file for every address it invents.
constexpr int kNewBoxesPerDay = 20;
constexpr std::string_view kForwardedHeader = "X-Velmor-Forwarded-By:";

std::time_t now() { return server_now ? server_now : std::time(nullptr); }

void debug(std::string_view text, std::string_view value = {}) {
  log_message(text, value, logfac::maildebatch);
}

// Logs a file below a home that was not what it must be (a link, another
// user's file, ...); such a file is never used.
void log_refused(const std::string& home, const SafeResult& r) {
  if (r.refused()) log_write("Mail delivery refused: " + safe_describe(home, r), logchan::errors);
}

// Where a group's redirect option sends its error mail: the option's
// address (completed with our domain), or the sender when it is unset.
std::string redirect_address(const GroupOptions& group, std::string_view key) {
  const std::string& to = group.text(key);
  if (to.empty()) return {};
  if (to.find('@') != std::string::npos) return to;
  return to + "@" + mail_primary_domain();
}

bool is_temporary(int error) {
  return error == ENOSPC || error == EDQUOT || error == EIO || error == EMFILE || error == ENFILE ||
         error == ENOMEM || error == EROFS || error == EFBIG || error == EAGAIN || error == EINTR;
}

// Writes a new incoming queue file and queues it. 0 or an errno value.
int queue_new_message(const std::function<int(CacheFile&)>& fill) {
  CacheFile file = queue_create_incoming();
  if (!file) return EIO;
  std::string path = filecache_path(file);
  int rc = fill(file);
  if (rc) {
    queue_file_discard(file);
    return rc;
  }
  if ((rc = filecache_close(file)) != 0) return rc;
  queue_add_incoming(path);
  return 0;
}

// Writes `length` bytes of a source from `offset` to a queue file.
int copy_to_queue(ByteSource& in, std::uint64_t offset, std::uint64_t length, CacheFile& out) {
  while (length > 0) {
    std::string_view v = in.view(offset, 64 * 1024);
    if (v.empty()) return EIO;
    v = v.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(v.size(), length)));
    if (int rc = filecache_write(out, v)) return rc;
    offset += v.size();
    length -= v.size();
  }
  return 0;
}

// Text as the body of a message in transmission form, ending with the "."
// line.
std::string as_transmission_body(std::string_view text) {
  std::string out = mail_body_lines(text);
  if (!out.empty() && out.back() != '\n') out += "\r\n";
  return out + ".\r\n";
}

}  // namespace

// ---- the queue file --------------------------------------------------------------

QueueLayout queue_layout(ByteSource& in) {
  QueueLayout q;
  Line first = read_line(in, 0, 1024);
  if (first.length == 0) return q;
  q.envelope = std::string(line_body(first.text));
  std::uint64_t pos = first.length;
  while (pos < in.size()) {
    Line line = read_line(in, pos, 16);
    if (line.length == 0) break;
    char c = line.text.empty() ? '\0' : static_cast<char>(line.text.front() | 0x20);
    if (c == 'r') {
      pos += line.length;
      continue;
    }
    q.data_line = pos;
    q.message = c == 'd' ? pos + line.length : pos;
    break;
  }
  if (q.message == 0) q.data_line = q.message = pos;
  // The header: the lines up to the first empty line (or the terminator).
  pos = q.message;
  while (pos < in.size()) {
    Line line = read_line(in, pos, kHeaderLineKeep);
    if (line.length == 0) break;
    std::string_view body = line_body(line.text);
    if (body.empty() || is_terminator_line(line.text)) break;
    bool folded = body.front() == ' ' || body.front() == '\t';
    if (folded && !q.header.empty()) {
      q.header.back().append(line.text);
    } else if (!folded) {
      q.header.emplace_back(line.text);
    }
    pos += line.length;
  }
  q.header_end = pos;
  return q;
}

std::string_view header_field(const QueueLayout& q, std::string_view name) {
  for (const std::string& h : q.header) {
    if (h.size() > name.size() && h[name.size()] == ':' && str_istarts_with(h, name)) {
      return trim_blanks(line_body(std::string_view(h).substr(name.size() + 1)));
    }
  }
  return {};
}

bool vacation_reply_wanted(const QueueLayout& q, std::string_view sender) {
  if (sender.empty() || sender == "<>") return false;
  for (char c : sender) {
    if (static_cast<unsigned char>(c) <= ' ' || c == '<' || c == '>') return false;
  }
  if (str_istarts_with(sender, "MAILER-DAEMON")) return false;
  std::string_view precedence = header_field(q, "Precedence");
  for (std::string_view word : {"bulk", "list", "junk"}) {
    if (str_istarts_with(precedence, word)) return false;
  }
  for (const std::string& h : q.header) {
    if (str_istarts_with(h, "List-Id:")) return false;
  }
  std::string_view auto_submitted = header_field(q, "Auto-Submitted");
  if (!auto_submitted.empty() && !str_istarts_with(auto_submitted, "no")) return false;
  return true;
}

bool vacation_note_sent(const std::string& record_path, std::string_view sender, std::time_t when) {
  // The record lies in the user's home: read and rewritten without
  // following links. A record that cannot be kept sends no reply.
  std::string folder(path_dir(record_path)), name(path_leaf(record_path));
  SafeDir home;
  UniqueFd fd;
  if (!SafeDir::open_root(folder, home).ok()) return false;
  SafeResult opened = home.open_file(name, O_RDONLY, fd);
  log_refused(folder, opened);
  if (!opened.ok() && opened.status != SafeStatus::missing) return false;
  std::string kept;
  bool recent = false;
  FileSource in(std::move(fd));
  std::uint64_t pos = 0;
  while (in.is_open() && pos < in.size()) {
    Line line = read_line(in, pos, 1024);
    if (line.length == 0) break;
    pos += line.length;
    std::string_view body = line_body(line.text);
    std::size_t blank = body.find(' ');
    if (blank == std::string_view::npos) continue;
    std::time_t t = static_cast<std::time_t>(std::strtoll(std::string(body.substr(0, blank)).c_str(), nullptr, 10));
    if (t + kVacationInterval <= when || t > when) continue;  // expired (or from the future)
    std::string_view who = body.substr(blank + 1);
    if (str_iequals(who, sender)) {
      recent = true;
      break;
    }
    kept.append(body);
    kept += '\n';
  }
  if (recent) return false;
  strappendf(kept, "%lld ", static_cast<long long>(when));
  kept.append(sender);
  kept += '\n';
  return home.replace_file(name, kept, 0600) == 0;
}

// ---- delivery -----------------------------------------------------------------

namespace {

struct Recipient {
  const UserRecord* user = nullptr;
  std::shared_ptr<const GroupOptions> group;
};

// The receive checks of the recipient's group; true when the message was
// refused (and the refusal mailed).
bool refused(const Recipient& r, QueuedMessage& msg, std::string_view sender) {
  const GroupOptions& g = *r.group;
  const std::string& user = r.user->login;
  const std::string& queue_file = msg.path;
  std::int64_t size = msg.size;
  std::uint32_t limit = g.size("mail.msg.size");
  if (limit && size > static_cast<std::int64_t>(limit)) {
    std::string shown(trim_blanks(size_text(static_cast<std::uint64_t>(size))));
    log_write(strprintf("[Mail] Oversize article [%s]:%s", shown.c_str(), user.c_str()),
              logchan::filter);
    mail_send_refusal(strprintf("The following email was greater than the %ukB length limit, at %lldkB\n",
                              limit / 1024, static_cast<long long>(size / 1024)),
                    redirect_address(g, "mail.large.redirect"), queue_file);
    return true;
  }
  const std::string& block = g.text("mail.address.recv.block");
  if (!block.empty() && wildcard_match(sender, block) && !wildcard_match(sender, g.text("mail.address.recv.allow"))) {
    debug("Sent by forbidden user");
    log_write(strprintf("[Mail] Blocked sender [%.*s] for: %s", static_cast<int>(sender.size()), sender.data(),
                        user.c_str()),
              logchan::filter);
    mail_send_refusal("The following email was sent by a forbidden user\n", redirect_address(g, "mail.block.redirect"),
                    queue_file);
    return true;
  }
  const std::string& filter = g.text("mail.filter");
  if (!filter.empty() && msg.filter_hit(filter)) {
    log_write(strprintf("[Mail] Banned word/phrase found: %s", user.c_str()), logchan::filter);
    mail_send_refusal("The following email contained a forbidden phrase\n", redirect_address(g, "mail.filter.redirect"),
                    queue_file);
    return true;
  }
  return false;
}

// The first line of a small file in the home folder, trimmed.
std::string first_line_of(const SafeDir& home, const std::string& home_path, std::string_view name) {
  UniqueFd fd;
  SafeResult opened = home.open_file(name, O_RDONLY, fd);
  log_refused(home_path, opened);
  if (!opened.ok()) return {};
  FileSource in(std::move(fd));
  Line line = read_line(in, 0, 1024);
  return std::string(trim_blanks(line_body(line.text)));
}

// Honours <home>/.forward: the message goes on to its address as a new
// queue file and no local copy is kept. False when delivery is to go on
// locally: no forward file, a forward back to this same user, a message
// that has already passed this user's forward (a loop between users), or
// a queue file that could not be written.
bool forwarded(const Recipient& r, const SafeDir& home, ByteSource& in, const QueueLayout& q) {
  std::string target = first_line_of(home, r.user->home, ".forward");
  while (!target.empty() && (target.front() == '<')) target.erase(0, 1);
  if (auto gt = target.find('>'); gt != std::string::npos) target.erase(gt);
  if (target.empty() || target.find_first_of(" \t\r\n") != std::string::npos) return false;
  if (auto local = mail_local_user(target)) {
    const UserRecord* u = user_find(*local);
    if (u == r.user) return false;
  }
  int hops = 0;
  for (const std::string& h : q.header) {
    if (!str_istarts_with(h, kForwardedHeader)) continue;
    ++hops;
    if (str_iequals(trim_blanks(line_body(std::string_view(h).substr(kForwardedHeader.size()))), r.user->login)) {
      debug("Forward loop, delivering locally for:", r.user->login);
      return false;
    }
  }
  if (hops >= kMaxForwardHops) return false;
  int rc = queue_new_message([&](CacheFile& out) {
    std::string head = q.envelope + "\r\nRCPT TO:<" + target + ">\r\nDATA\r\n" + std::string(kForwardedHeader) +
                       " " + r.user->login + "\r\n";
    if (int e = filecache_write(out, head)) return e;
    return copy_to_queue(in, q.message, in.size() - q.message, out);
  });
  if (rc) {
    debug("Forward queue file failed, delivering locally:", error_text(rc));
    return false;
  }
  debug("Forwarded to:", target);
  mail_log(strprintf("Forwarded: %s to %s by %s/.forward (%llu bytes)", r.user->login.c_str(), target.c_str(),
                     r.user->home.c_str(), static_cast<unsigned long long>(in.size())));
  return true;
}

void vacation(const Recipient& r, const SafeDir& home, const QueueLayout& q, std::string_view sender) {
  UniqueFd fd;
  SafeResult opened = home.open_file(".vacation", O_RDONLY, fd);
  log_refused(r.user->home, opened);
  if (!opened.ok() || !vacation_reply_wanted(q, sender)) return;
  if (!vacation_note_sent(path_join(r.user->home, ".vacation.sent"), sender, now())) return;
  FileSource text(std::move(fd));
  std::string_view body = text.view(0, static_cast<std::size_t>(std::min<std::uint64_t>(text.size(), 256 * 1024)));
  std::string me = r.user->login + "@" + mail_primary_domain();
  std::string s(sender);
  int rc = queue_new_message([&](CacheFile& out) {
    std::string msg = "MAIL FROM:<" + me + ">\r\nRCPT TO:<" + s + ">\r\nDATA\r\n";
    msg += "Date: " + mail_date_text(now()) + "\r\n";
    msg += "From: " + me + "\r\nTo: " + s + "\r\nSubject: Vacation Message\r\n";
    msg += "Precedence: bulk\r\nAuto-Submitted: auto-replied\r\n\r\n";
    msg += as_transmission_body(body);
    return filecache_write(out, msg);
  });
  if (rc) {
    debug("Vacation reply could not be queued:", error_text(rc));
  } else {
    mail_log("Vacation reply: to " + s + " for " + r.user->login);
  }
}

// How much of a message one piece writes or parses.
constexpr std::uint64_t kPieceBytes = 1024 * 1024;


std::unordered_map<std::string, std::pair<std::time_t, int>> g_new_boxes;  // login -> day, boxes made

bool new_box_allowed(const std::string& login) {
  auto& [day, made] = g_new_boxes[login];
  if (day != now() / 86400) {
    day = now() / 86400;
    made = 0;
  }
  return made < kNewBoxesPerDay;
}

// What becomes of a message whose mailbox cannot be opened: while the
// suite may not write in the home it waits, as it does for a full disk;
// anything else goes to oddments.
LocalOutcome open_failed(const Recipient& r, const std::string& queue_file, const SafeResult& why) {
  debug("Mailbox open failed");
  std::string what = safe_describe(r.user->home, why);
  if (why.refused()) {
    log_write("Mail delivery refused: " + what, logchan::errors);
  } else if (why.error == EACCES || why.error == EPERM || is_temporary(why.error)) {
    log_write("Mail delivery for `" + r.user->login + "' waits: " + what, logchan::errors);
    return LocalOutcome::temporary;
  }
  mail_move_to_oddments(queue_file, strprintf("Couldn't open mailbox for user `%s'", r.user->login.c_str()));
  return LocalOutcome::handled;
}

}  // namespace

QueuedMessage::QueuedMessage(std::string p) : path(std::move(p)), in(path) {
  if (in.is_open()) {
    layout = queue_layout(in);
    size = static_cast<std::int64_t>(in.size());
  }
}

bool QueuedMessage::filter_hit(const std::string& filter) {
  auto found = filter_hits.find(filter);
  if (found != filter_hits.end()) return found->second;
  bool hit = mail_filter_match(filter, path);
  filter_hits.emplace(filter, hit);
  return hit;
}

bool mailbox_recipient_known(std::string_view recipient) {
  auto local = mail_local_user(recipient);
  if (!local) return false;
  if (local->size() > 63) local->resize(63);
  const UserRecord* u = user_find(*local);
  return u && !u->home.empty();
}

struct LocalDelivery::State {
  std::shared_ptr<QueuedMessage> msg;
  std::string recipient, sender;
  std::function<void(int)> committed;
  enum class Phase { checks, open, write, parse } phase = Phase::checks;
  Recipient r;
  std::string box_name, path;
  Mailbox* box = nullptr;
  AppendSlot slot;

  // The message as it is written: the header without the lines that carry
  // mailbox state, our own lines, the body, and a closing "." line should
  // the queue file lack one.
  enum class Part { header, raw, blank, ours, body, close, done } part = Part::header;
  std::uint64_t pos = 0;        // in the queue file
  std::uint64_t raw_left = 0;   // of a header line too long to hold, still to copy
  std::uint64_t at = 0;         // in the mailbox
  bool dropping = false;
  std::string tail;             // the last bytes written, to see whether the terminator came
  std::string out;

  std::unique_ptr<FileSource> written;
  std::unique_ptr<LimitedSource> limited;
  std::unique_ptr<MessageParser> parser;

  ByteSource& in() { return msg->in; }

  LocalOutcome waits(const std::string& why) {
    log_write("Mail delivery for `" + r.user->login + "' waits: " + why, logchan::errors);
    return LocalOutcome::temporary;
  }

  // The receive checks, forward and vacation: done once.
  std::optional<LocalOutcome> checks() {
    debug("Mailbox append for:", recipient);
    debug("Mailbox append from:", sender);
    std::shared_ptr<const GroupOptions> sender_group;
    if (auto s = mail_local_user(sender); s && user_find(*s)) {
      sender_group = user_group(user_find(*s)->login);
    } else {
      sender_group = group_default();
    }
    bool exempt = sender_group && (sender_group->mail_flags & gflag::mail_override);
    auto local = mail_local_user(recipient);
    if (!local) return LocalOutcome::handled;  // not ours (the caller asked mailbox_recipient_known)
    if (local->size() > 63) local->resize(63);
    debug("Mailbox local user is:", *local);
    r.user = user_find(*local);
    if (!r.user || r.user->home.empty()) return LocalOutcome::handled;
    r.group = user_group(r.user->login);
    if (!exempt && r.group && refused(r, *msg, sender)) return LocalOutcome::handled;
    if (!msg->readable()) return LocalOutcome::temporary;

    // The home is trusted; everything below it is the user's, and is reached
    // without following links (core/safedir.h).
    SafeDir home;
    SafeResult opened = SafeDir::open_root(r.user->home, home);
    if (opened.status == SafeStatus::missing) {
      make_path(r.user->home);
      opened = SafeDir::open_root(r.user->home, home);
    }
    if (opened.ok() && r.group && (r.group->mail_flags & gflag::mail_forward) &&
        forwarded(r, home, in(), msg->layout))
      return LocalOutcome::handled;
    if (opened.ok() && r.group && (r.group->mail_flags & gflag::mail_vacation)) vacation(r, home, msg->layout, sender);
    box_name = mailbox_box_for_address(recipient);
    if (box_name != "inbox") {
      debug("Appending mailbox in email address:", box_name);
    } else {
      debug("Using inbox");
    }
    return std::nullopt;
  }

  // Opens the mailbox and reserves the place behind its last message.
  std::optional<LocalOutcome> open() {
    const std::string& home_path = r.user->home;
    SafeDir home, folder;
    SafeResult opened = SafeDir::open_root(home_path, home);
    if (opened.ok()) opened = home.open_dir("mail", true, folder);
    bool made = opened.ok() && box_name != "inbox" && !folder.has(box_name);
    if (made && !new_box_allowed(r.user->login)) {
      debug("Too many new mailboxes today, using inbox for:", box_name);
      box_name = "inbox";
      made = false;
    }
    debug(strprintf("using box `%s'", box_name.c_str()));
    path = path_join(path_join(home_path, "mail"), box_name);
    debug("Trying to open mailbox");
    UniqueFd fd;
    if (opened.ok()) opened = home.open_file("mail/" + box_name, O_RDWR | O_CREAT, fd, 0600);
    if (opened.ok() && made) ++g_new_boxes[r.user->login].second;
    box = opened.ok() ? mailbox_lookup(path, home_path) : nullptr;
    if (opened.ok() && !box) opened = SafeResult{SafeStatus::failed, EIO, "mail/" + box_name};
    if (!opened.ok()) return open_failed(r, msg->path, opened);
    int rc = mailbox_append_begin(*box, std::move(fd), slot);
    if (rc == ESTALE) return waits(path + " does not match its records");
    if (rc) return waits(path + ": " + error_text(rc));
    out = mailbox_separator(msg->layout.envelope, now());
    part = Part::header;
    pos = msg->layout.message;
    at = slot.offset;
    dropping = false;
    tail.clear();
    return std::nullopt;
  }

  void put(std::string_view data) {
    out.append(data);
    tail.append(data.substr(data.size() > 5 ? data.size() - 5 : 0));
    if (tail.size() > 5) tail.erase(0, tail.size() - 5);
  }

  // Copies up to `left` bytes from the queue file; EIO when it ends first.
  int copy(std::uint64_t& left, std::uint64_t budget) {
    while (left > 0 && out.size() < budget) {
      std::string_view v = in().view(pos, 64 * 1024);
      if (v.empty()) return EIO;
      v = v.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(v.size(), left)));
      put(v);
      pos += v.size();
      left -= v.size();
    }
    return 0;
  }

  // Fills `out` with about `budget` bytes of the message; 0 or an errno value.
  int fill(std::uint64_t budget) {
    const QueueLayout& q = msg->layout;
    while (out.size() < budget && part != Part::done) {
      switch (part) {
        case Part::header: {
          if (pos >= q.header_end) {
            part = Part::blank;
            break;
          }
          Line line = read_line(in(), pos, kHeaderLineKeep);
          if (line.length == 0) {
            part = Part::blank;
            break;
          }
          bool folded = line.text.front() == ' ' || line.text.front() == '\t';
          if (!folded) dropping = mailbox_header_dropped(line.text);
          if (dropping) {
            pos += line.length;
          } else if (line.length == line.text.size()) {
            pos += line.length;
            put(line_body(line.text));
            put("\r\n");
          } else {  // a header line longer than we keep in memory: copied as it is
            raw_left = line.length;
            part = Part::raw;
          }
          break;
        }
        case Part::raw:
          if (int rc = copy(raw_left, budget)) return rc;
          if (raw_left == 0) part = Part::header;
          break;
        case Part::blank: {
          // Empty lines at the start of the body are dropped with the header's end.
          std::string_view v = in().view(pos, 2);
          if (v.substr(0, 2) == "\r\n") {
            pos += 2;
          } else if (!v.empty() && v.front() == '\n') {
            pos += 1;
          } else {
            part = Part::ours;
          }
          break;
        }
        case Part::ours:
          put("X-RCPT-TO: ");
          put(r.user->login);
          put("\r\nX-Processed-By: Velmor Mail Suite (");
          put(kVersion);
          put(")\r\n");
          put(strprintf("X-UID: %u\r\n\r\n", slot.uid));
          part = Part::body;
          break;
        case Part::body: {
          std::uint64_t left = in().size() - pos;
          if (int rc = copy(left, budget)) return rc;
          if (pos >= in().size()) part = Part::close;
          break;
        }
        case Part::close:
          if (tail != "\r\n.\r\n" && tail.substr(std::min<std::size_t>(2, tail.size())) != "\n.\n") {
            // A queue file without its terminator: the message is closed here,
            // so the next one in the mailbox still starts at a separator.
            if (!tail.empty() && tail.back() != '\n') put("\r\n");
            put(".\r\n");
          }
          part = Part::done;
          break;
        case Part::done:
          break;
      }
    }
    return in().failed() ? EIO : 0;
  }

  // One piece of the message written; true when all of it is.
  int write_piece(bool& finished) {
    int rc = fill(kPieceBytes);
    if (!rc) rc = pwrite_all(mailbox_append_fd(*box), out, at);
    at += out.size();
    out.clear();
    finished = part == Part::done;
    return rc;
  }

  std::optional<LocalOutcome> failed(int rc) {
    mailbox_append_abandon(*box, slot);
    return waits(path + ": " + error_text(rc));
  }

  std::optional<LocalOutcome> piece(std::uint64_t& work) {
    switch (phase) {
      case Phase::checks:
        if (auto done = checks()) return done;
        phase = Phase::open;
        [[fallthrough]];
      case Phase::open:
        if (auto done = open()) return done;
        phase = Phase::write;
        return std::nullopt;
      case Phase::write: {
        if (mailbox_append_stale(*box, slot)) return restart();
        bool finished = false;
        std::uint64_t before = at;
        if (int rc = write_piece(finished)) return failed(rc);
        work += at - before;
        if (finished) {
          written = std::make_unique<FileSource>(mailbox_append_fd(*box));
          limited = std::make_unique<LimitedSource>(*written, at);
          parser = std::make_unique<MessageParser>(slot.offset);
          phase = Phase::parse;
        }
        return std::nullopt;
      }
      case Phase::parse: {
        if (mailbox_append_stale(*box, slot)) return restart();
        work += kPieceBytes;
        if (!parser->step(*limited, kPieceBytes)) return std::nullopt;
        std::uint64_t next = 0;
        MessageRecord rec = parser->take(next);
        parser.reset();
        limited.reset();
        written.reset();
        if (rec.total_length != at - slot.offset || next != kNoMessage) return failed(EIO);
        mailbox_append_stage(*box, slot, std::move(rec),
                             [done = std::move(committed), login = r.user->login, where = path, to = recipient,
                              size = at - slot.offset](int error) {
                               if (error) {
                                 log_write("Mail delivery for `" + login + "' waits: " + where + ": " + error_text(error),
                                           logchan::errors);
                               } else {
                                 mail_log(strprintf("Delivered: %s to %s (%llu bytes)", to.c_str(), where.c_str(),
                                                    static_cast<unsigned long long>(size)));
                               }
                               if (done) done(error);
                             });
        return LocalOutcome::staged;
      }
    }
    return LocalOutcome::temporary;
  }

  // The mailbox was replaced or cut back under the message: written again
  // behind its new end.
  std::optional<LocalOutcome> restart() {
    parser.reset();
    limited.reset();
    written.reset();
    out.clear();
    phase = Phase::open;
    return std::nullopt;
  }
};

LocalDelivery::LocalDelivery(std::shared_ptr<QueuedMessage> message, std::string recipient, std::string sender,
                             std::function<void(int)> committed)
    : s_(std::make_unique<State>()) {
  s_->msg = std::move(message);
  s_->recipient = std::move(recipient);
  s_->sender = std::move(sender);
  s_->committed = std::move(committed);
}
LocalDelivery::LocalDelivery(LocalDelivery&&) noexcept = default;
LocalDelivery& LocalDelivery::operator=(LocalDelivery&&) noexcept = default;
LocalDelivery::~LocalDelivery() {
  // Given up half way (the suite stops): the mailbox is cut back.
  if (s_ && s_->box && (s_->phase == State::Phase::write || s_->phase == State::Phase::parse))
    mailbox_append_abandon(*s_->box, s_->slot);
}

LocalOutcome LocalDelivery::step(std::chrono::steady_clock::time_point deadline) {
  // A piece is a megabyte of writing or parsing: a small message goes in
  // whole, a large one a piece at a time until the deadline.
  std::uint64_t work = 0;
  for (;;) {
    std::optional<LocalOutcome> done = s_->piece(work);
    if (done && *done != LocalOutcome::working) {
      s_->phase = State::Phase::checks;
      s_->box = nullptr;
      return *done;
    }
    if (work >= kPieceBytes && std::chrono::steady_clock::now() >= deadline) return LocalOutcome::working;
  }
}

int mailbox_append(const std::string& queue_file, std::string_view recipient, std::string_view sender) {
  if (!mailbox_recipient_known(recipient)) return 0;
  int committed = EIO;
  LocalDelivery d(std::make_shared<QueuedMessage>(queue_file), std::string(recipient), std::string(sender),
                  [&committed](int error) { committed = error; });
  LocalOutcome o;
  while ((o = d.step(std::chrono::steady_clock::time_point::max())) == LocalOutcome::working) {
  }
  if (o == LocalOutcome::staged) {
    mailbox_commit_staged();
    return committed == 0 ? 1 : kAppendTemporaryFailure;
  }
  return o == LocalOutcome::handled ? 1 : kAppendTemporaryFailure;
}

// ---- read receipts --------------------------------------------------------------

namespace {

// The address a receipt goes to: of the From value's words, the last
// address; without one, the words joined and completed with our domain.
std::string receipt_address(std::string_view from) {
  std::string last, words, word;
  std::size_t cursor = 0;
  for (AddressToken t; (t = address_token_next(from, cursor, word)) != AddressToken::end;) {
    if (t == AddressToken::comma) continue;
    if (word.find('@') != std::string::npos) {
      last = word;
    } else {
      words += word;
    }
  }
  if (!last.empty()) return last;
  if (words.empty()) return {};
  return words + "@" + mail_primary_domain();
}

bool plain_address(std::string_view a) {
  if (a.empty()) return false;
  for (char c : a) {
    if (static_cast<unsigned char>(c) <= ' ' || c == '<' || c == '>' || c == 0x7f) return false;
  }
  return true;
}

}  // namespace

int mailbox_mark_seen(Mailbox& box, MessageRecord& message, std::uint64_t offset, std::string_view user) {
  if (message.flags & msgflag::seen) return 0;
  message.flags |= msgflag::seen;
  if (box.unseen > 0) --box.unseen;
  mailbox_flags_changed(box, message);
  if (!(message.flags & msgflag::receipt_wanted)) return 0;

  // The header of the message as stored.
  FileSource in(mailbox_open(box));
  std::uint64_t pos = offset + (message.total_length - message.length);
  std::uint64_t end = offset + message.header_length;
  std::vector<std::string> header;
  while (pos < end && pos < in.size()) {
    Line line = read_line(in, pos, kHeaderLineKeep);
    if (line.length == 0 || line_body(line.text).empty()) break;
    pos += line.length;
    if ((line.text.front() == ' ' || line.text.front() == '\t') && !header.empty()) continue;
    header.emplace_back(line_body(line.text));
  }
  auto value = [&](std::string_view name) -> std::optional<std::string> {
    for (const std::string& h : header) {
      if (h.size() > name.size() && h[name.size()] == ':' && str_istarts_with(h, name)) {
        return std::string(trim_blanks(std::string_view(h).substr(name.size() + 1)));
      }
    }
    return std::nullopt;
  };
  auto from = value("From");
  auto subject = value("Subject");
  if (!from || !subject) return 0;  // nobody to tell, or nothing to tell about
  std::string to = receipt_address(*from);
  if (!plain_address(to)) return 0;
  const UserRecord* u = user_find(user);
  std::string login = u ? u->login : std::string(user);
  std::string full_name = u ? u->full_name : login;
  std::string domain = mail_primary_domain();
  std::string me = login + "@" + domain;
  auto date = value("Date");
  std::string text = "MAIL FROM:<" + me + ">\r\nRCPT TO:<" + to + ">\r\nDATA\r\nTo: " + *from + "\r\nFrom: " +
                     full_name + " <" + me + ">\r\nDate: " + mail_date_text(now()) +
                     "\r\nSubject: Read Receipt (Original:" + *subject +
                     ")\r\n\r\n  This is an automatically generated response to inform you that\r\n     " + full_name +
                     " <mailto:" + me + ">\r\n  has received, and read your email about:\r\n     " + *subject;
  if (date) text += "  (" + *date + ")";
  text += "\r\n\r\n  This is purely an informative message, and does not require any action \r\n  on your "
          "part.\r\n\r\n  If you believe you should not have recevied this message, or if there any\r\n  other "
          "problems with this mail, please email <mailto:postmaster@" +
          domain + ">\r\n\r\n.\r\n";
  int rc = queue_new_message([&](CacheFile& out) { return filecache_write(out, text); });
  if (rc) debug("Read receipt could not be queued:", error_text(rc));
  return rc;
}

}  // namespace velmor
