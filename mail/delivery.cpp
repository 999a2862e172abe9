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
bool refused(const Recipient& r, const std::string& queue_file, std::string_view sender) {
  const GroupOptions& g = *r.group;
  const std::string& user = r.user->login;
  std::int64_t size = file_size(queue_file);
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
  if (!filter.empty() && mail_filter_match(filter, queue_file)) {
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
  if (rc) debug("Vacation reply could not be queued:", error_text(rc));
}

// Cuts the mailbox back to what it held before a failed append.
void take_back(int fd, std::uint64_t old_size) {
  if (sysio::ftruncate(fd, static_cast<off_t>(old_size)) == 0) sysio::fsync(fd);
}

// Appends the message to the mailbox file at `old_size` and syncs it. 0 or
// an errno value; on failure the file is cut back to `old_size`.
int append_message(int box, std::uint64_t old_size, ByteSource& in, const QueueLayout& q, std::string_view user,
                   std::uint32_t uid) {
  std::string out = mailbox_separator(q.envelope, now());
  std::uint64_t at = old_size;
  int rc = 0;
  std::string tail;  // the last bytes written, to see whether the terminator came
  auto flush = [&] {
    if (!rc) rc = pwrite_all(box, out, at);
    at += out.size();
    out.clear();
  };
  auto put = [&](std::string_view data) {
    if (rc) return;
    out.append(data);
    tail.append(data.substr(data.size() > 5 ? data.size() - 5 : 0));
    if (tail.size() > 5) tail.erase(0, tail.size() - 5);
    if (out.size() >= 64 * 1024) flush();
  };
  // The header, without the lines that carry mailbox state.
  std::uint64_t pos = q.message;
  bool dropping = false;
  while (pos < q.header_end && !rc) {
    Line line = read_line(in, pos, kHeaderLineKeep);
    if (line.length == 0) break;
    pos += line.length;
    bool folded = line.text.front() == ' ' || line.text.front() == '\t';
    if (!folded) dropping = mailbox_header_dropped(line.text);
    if (dropping) continue;
    if (line.length == line.text.size()) {
      put(line_body(line.text));
      put("\r\n");
    } else {  // a header line longer than we keep in memory: copied as it is
      for (std::uint64_t o = line.offset, left = line.length; left > 0 && !rc;) {
        std::string_view v = in.view(o, 64 * 1024);
        if (v.empty()) {
          rc = EIO;
          break;
        }
        v = v.substr(0, static_cast<std::size_t>(std::min<std::uint64_t>(v.size(), left)));
        put(v);
        o += v.size();
        left -= v.size();
      }
    }
  }
  // Empty lines at the start of the body are dropped with the header's end.
  while (pos < in.size()) {
    Line line = read_line(in, pos, 4);
    if (line.length == 0 || line_body(line.text).size() != 0 || line.length > 2) break;
    pos += line.length;
  }
  put("X-RCPT-TO: ");
  put(user);
  put("\r\nX-Processed-By: Velmor Mail Suite (");
  put(kVersion);
  put(")\r\n");
  put(strprintf("X-UID: %u\r\n\r\n", uid));
  while (pos < in.size() && !rc) {
    std::string_view v = in.view(pos, 64 * 1024);
    if (v.empty()) {
      rc = EIO;
      break;
    }
    put(v);
    pos += v.size();
  }
  if (!rc && tail != "\r\n.\r\n" && tail.substr(2) != "\n.\n") {
    // A queue file without its terminator: the message is closed here, so
    // the next one in the mailbox still starts at a separator.
    if (!tail.empty() && tail.back() != '\n') put("\r\n");
    put(".\r\n");
  }
  flush();
  if (!rc && sysio::fsync(box) != 0) rc = errno;
  if (rc) take_back(box, old_size);
  return rc;
}

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
int open_failed(const Recipient& r, const std::string& queue_file, const SafeResult& why) {
  debug("Mailbox open failed");
  std::string what = safe_describe(r.user->home, why);
  if (why.refused()) {
    log_write("Mail delivery refused: " + what, logchan::errors);
  } else if (why.error == EACCES || why.error == EPERM || is_temporary(why.error)) {
    log_write("Mail delivery for `" + r.user->login + "' waits: " + what, logchan::errors);
    return kAppendTemporaryFailure;
  }
  mail_move_to_oddments(queue_file, strprintf("Couldn't open mailbox for user `%s'", r.user->login.c_str()));
  return 1;
}

}  // namespace

int mailbox_append(const std::string& queue_file, std::string_view recipient, std::string_view sender) {
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
  if (!local) return 0;
  if (local->size() > 63) local->resize(63);
  debug("Mailbox local user is:", *local);
  Recipient r;
  r.user = user_find(*local);
  if (!r.user || r.user->home.empty()) return 0;
  r.group = user_group(r.user->login);

  if (!exempt && r.group && refused(r, queue_file, sender)) return 1;

  FileSource in(queue_file);
  if (!in.is_open()) return kAppendTemporaryFailure;
  QueueLayout q = queue_layout(in);
  if (in.failed()) return kAppendTemporaryFailure;

  // The home is trusted; everything below it is the user's, and is reached
  // without following links (core/safedir.h).
  const std::string& home_path = r.user->home;
  SafeDir home;
  SafeResult opened = SafeDir::open_root(home_path, home);
  if (opened.status == SafeStatus::missing) {
    make_path(home_path);
    opened = SafeDir::open_root(home_path, home);
  }
  bool home_ok = opened.ok();
  if (home_ok && r.group && (r.group->mail_flags & gflag::mail_forward) && forwarded(r, home, in, q)) return 1;
  if (home_ok && r.group && (r.group->mail_flags & gflag::mail_vacation)) vacation(r, home, q, sender);

  std::string box_name = mailbox_box_for_address(recipient);
  if (box_name != "inbox") {
    debug("Appending mailbox in email address:", box_name);
  } else {
    debug("Using inbox");
  }
  SafeDir folder;
  if (opened.ok()) opened = home.open_dir("mail", true, folder);
  bool made = opened.ok() && box_name != "inbox" && !folder.has(box_name);
  if (made && !new_box_allowed(r.user->login)) {
    debug("Too many new mailboxes today, using inbox for:", box_name);
    box_name = "inbox";
    made = false;
  }
  debug(strprintf("using box `%s'", box_name.c_str()));
  std::string path = path_join(path_join(home_path, "mail"), box_name);
  debug("Trying to open mailbox");
  UniqueFd fd;
  if (opened.ok()) opened = home.open_file("mail/" + box_name, O_RDWR | O_CREAT, fd, 0600);
  if (opened.ok() && made) ++g_new_boxes[r.user->login].second;
  Mailbox* box = opened.ok() ? mailbox_lookup(path, home_path) : nullptr;
  if (opened.ok() && !box) opened = SafeResult{SafeStatus::failed, EIO, "mail/" + box_name};
  if (!opened.ok()) return open_failed(r, queue_file, opened);

  // The message goes behind the last committed one. A file that does not
  // match its records (it could not be cut back, or changed while a session
  // holds it) waits, rather than glue the message to something unknown.
  struct stat st {};
  std::uint64_t old_size = mailbox_size(*box);
  if (::fstat(fd.get(), &st) != 0 || static_cast<std::uint64_t>(st.st_size) != old_size) {
    log_write("Mail delivery for `" + r.user->login + "' waits: " + path + " does not match its records",
              logchan::errors);
    return kAppendTemporaryFailure;
  }
  std::uint32_t uid = box->next_uid ? box->next_uid : 1;
  int rc = append_message(fd.get(), old_size, in, q, r.user->login, uid);
  if (!rc) {
    FileSource written(fd.get());
    rc = mailbox_commit(*box, written, old_size);
    if (rc) take_back(fd.get(), old_size);
  }
  if (rc) {
    log_write("Mail delivery for `" + r.user->login + "' waits: " + path + ": " + error_text(rc), logchan::errors);
    return kAppendTemporaryFailure;
  }
  box->flags |= boxflag::new_mail | boxflag::delivered;
  return 1;
}

// ---- read receipts --------------------------------------------------------------

namespace {

// The address a receipt goes to: of the From value's words, the last that
// holds an "@" (angle brackets and quotes removed); without one, the words
// joined and completed with our domain.
std::string receipt_address(std::string_view from) {
  std::string last, words;
  std::size_t i = 0;
  while (i < from.size()) {
    while (i < from.size() && (from[i] == ' ' || from[i] == '\t' || from[i] == ',')) ++i;
    if (i >= from.size()) break;
    std::string word;
    if (from[i] == '"') {
      std::size_t end = from.find('"', i + 1);
      word = from.substr(i + 1, end == std::string_view::npos ? std::string_view::npos : end - i - 1);
      i = end == std::string_view::npos ? from.size() : end + 1;
    } else if (from[i] == '<') {
      std::size_t end = from.find('>', i + 1);
      word = from.substr(i + 1, end == std::string_view::npos ? std::string_view::npos : end - i - 1);
      i = end == std::string_view::npos ? from.size() : end + 1;
    } else if (from[i] == '(') {
      std::size_t end = from.find(')', i + 1);
      i = end == std::string_view::npos ? from.size() : end + 1;
      continue;
    } else {
      std::size_t end = from.find_first_of(" \t,<(\"", i);
      word = from.substr(i, end == std::string_view::npos ? std::string_view::npos : end - i);
      i = end == std::string_view::npos ? from.size() : end;
    }
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
  box.changed = true;
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
