// The mail queues: file names, the incoming and outgoing lists, scans, the
// mail poll, error mails and the oddments folder.
#include "mail/queue.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <ctime>

#include "core/config.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/textfile.h"
#include "core/util.h"
#include "mail/queue_internal.h"
#include "mail/queue_text.h"

namespace velmor {

namespace {

std::list<std::string> g_incoming;
std::list<OutgoingEntry> g_outgoing;
std::uint64_t g_next_incoming = 0;
std::uint64_t g_next_outgoing = 0;
std::vector<std::string> g_reject;  // sender patterns in file order

std::string dir_of(const ConfigText& key, const char* fallback) {
  return key && !key->empty() ? *key : std::string(fallback);
}
std::string incoming_dir() { return dir_of(config.mail_dir_incoming, "mail/in"); }
std::string outgoing_dir() { return dir_of(config.mail_dir_outgoing, "mail/out"); }
std::string oddments_dir() { return dir_of(config.mail_dir_oddments, "mail/odd"); }

// Queue file names are decimal numbers; anything else in the folders (the
// hidden names files are written under, editor leftovers) is not mail.
bool is_queue_name(std::string_view name) {
  return !name.empty() && name.find_first_not_of("0123456789") == std::string_view::npos;
}

std::vector<std::string> queue_files(const std::string& dir) {
  std::vector<std::string> names;
  DIR* d = opendir(dir.c_str());
  if (!d) return names;
  while (dirent* e = readdir(d)) {
    if (is_queue_name(e->d_name)) names.emplace_back(e->d_name);
  }
  closedir(d);
  std::sort(names.begin(), names.end(), [](const std::string& a, const std::string& b) {
    return a.size() != b.size() ? a.size() < b.size() : a < b;
  });
  std::vector<std::string> paths;
  for (const std::string& n : names) {
    std::string p = path_join(dir, n);
    if (file_is_regular(p)) paths.push_back(std::move(p));
  }
  return paths;
}

// A message half written when the suite stopped was never acknowledged:
// its hidden file is removed at start-up.
void remove_unfinished(const std::string& dir) {
  DIR* d = opendir(dir.c_str());
  if (!d) return;
  std::vector<std::string> stale;
  while (dirent* e = readdir(d)) {
    std::string_view n = e->d_name;
    if (n.size() > 5 && n.front() == '.' && n.substr(n.size() - 4) == ".new" &&
        is_queue_name(n.substr(1, n.size() - 5)))
      stale.push_back(path_join(dir, n));
  }
  closedir(d);
  for (const std::string& p : stale) unlink(p.c_str());
}

// Takes the next free number: the final name must not exist, and the hidden
// name the file is written under is created exclusively, so no name that
// holds mail, or is being written, is ever handed out twice.
std::string new_name(const std::string& dir, std::uint64_t& counter) {
  make_path(dir);
  for (int tries = 0; tries < 10000; ++tries) {
    std::string leaf = std::to_string(counter++);
    std::string path = path_join(dir, leaf);
    if (access(path.c_str(), F_OK) == 0) continue;
    std::string hidden = path_join(dir, "." + leaf + ".new");
    int fd = open(hidden.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC, 0660);
    if (fd < 0) {
      if (errno == EEXIST) continue;
      log_write(strprintf("Mail queue: can't create %s: %s", hidden.c_str(), error_text(errno).c_str()),
                logchan::errors);
      return {};
    }
    close(fd);
    return path;
  }
  return {};
}

// The hidden name a queue file is written under before it takes its name.
std::string hidden_name(const std::string& path) {
  return path_join(path_dir(path), "." + std::string(path_leaf(path)) + ".new");
}

void unreserve(const std::string& path) { unlink(hidden_name(path).c_str()); }

OutgoingEntry outgoing_entry(const std::string& path) {
  OutgoingEntry e;
  e.path = path;
  e.route = "default";
  e.mtime = file_mtime(path);
  e.size = file_size(path);
  CacheFile f = filecache_open(path, FileMode::read);
  if (!f) return e;
  QueueEnvelope env = queue_read_envelope(f);
  filecache_close(f);
  e.sender = env.sender;
  for (const std::string& r : env.recipients) {
    if (!e.recipients.empty()) e.recipients += ", ";
    e.recipients += r;
  }
  if (!env.recipients.empty()) {
    std::string_view domain = address_domain(env.recipients.front());
    if (!domain.empty() && config.smtp_direct && wildcard_match(domain, *config.smtp_direct))
      e.route = std::string(domain);
  }
  return e;
}

void note_outgoing_count() {
  status_bits |= status::mail_queue_changed;
  if (config.mail_auto_send > 0 && g_outgoing.size() >= static_cast<std::size_t>(config.mail_auto_send) &&
      mail_transfer_state == 0 && !link_up)
    mail_transfer_state = 4;
}

}  // namespace

void queue_list(const std::function<void(std::string_view)>& send) {
  send("start mq\n");
  for (const OutgoingEntry& e : g_outgoing) {
    send(strprintf("%-16s %-6s %-30s", time_text(e.mtime).c_str(),
                   size_text(static_cast<std::uint64_t>(std::max<std::int64_t>(e.size, 0))).c_str(),
                   e.sender.c_str()));
    send(e.recipients);
    send("\n");
  }
  send("end mq\n");
}

// ---- names and lists --------------------------------------------------------

std::string queue_new_incoming_name() { return new_name(incoming_dir(), g_next_incoming); }
std::string queue_new_outgoing_name() { return new_name(outgoing_dir(), g_next_outgoing); }

CacheFile queue_create_incoming() {
  std::string path = queue_new_incoming_name();
  if (path.empty()) return {};
  CacheFile f = filecache_open(path, FileMode::write);
  if (!f) unreserve(path);
  return f;
}

std::string queue_incoming_dir() { return incoming_dir(); }

PendingIncoming queue_open_incoming_pending() {
  PendingIncoming p;
  p.path = queue_new_incoming_name();
  if (p.path.empty()) return p;
  p.hidden = hidden_name(p.path);
  p.file = filecache_open(p.hidden, FileMode::append);
  if (!p.file) unlink(p.hidden.c_str());
  return p;
}

namespace {
struct Commit {
  std::string path, hidden;
  std::function<void(int error)> done;
};
std::vector<Commit> g_commits;
}  // namespace

void queue_commit_later(std::string path, std::string hidden, std::function<void(int error)> done) {
  g_commits.push_back({std::move(path), std::move(hidden), std::move(done)});
}

bool queue_commit_pending() { return !g_commits.empty(); }

void queue_commit_register() {
  // Each service that commits asks; a second hook finds nothing left to do.
  after_pass([] { queue_commit(); });
}

void queue_commit() {
  std::vector<Commit> batch;
  batch.swap(g_commits);
  if (batch.empty()) return;
  std::string dir = incoming_dir();
  int dir_fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  int error = dir_fd < 0 ? errno : (sysio::syncfs(dir_fd) == 0 ? 0 : errno);
  std::vector<int> errors(batch.size(), error);
  bool renamed = false;
  for (std::size_t i = 0; i < batch.size(); ++i) {
    if (errors[i] == 0 && sysio::rename(batch[i].hidden.c_str(), batch[i].path.c_str()) != 0) errors[i] = errno;
    if (errors[i] == 0) renamed = true;
  }
  if (renamed && sysio::fsync(dir_fd) != 0) {
    // The renames may not last: take them back rather than acknowledge them.
    int e = errno;
    for (std::size_t i = 0; i < batch.size(); ++i)
      if (errors[i] == 0) {
        unlink(batch[i].path.c_str());
        errors[i] = e;
      }
  }
  if (dir_fd >= 0) close(dir_fd);
  for (std::size_t i = 0; i < batch.size(); ++i) {
    if (errors[i] == 0) {
      queue_add_incoming(batch[i].path);
    } else {
      unlink(batch[i].hidden.c_str());
      log_write(strprintf("Mail queue: %s not queued: %s", batch[i].path.c_str(), error_text(errors[i]).c_str()),
                logchan::errors);
    }
    if (batch[i].done) batch[i].done(errors[i]);
  }
}

int queue_rewrite_envelope(CacheFile& file, const QueueEnvelope& env, std::string_view first_line,
                           const std::vector<std::string>& recipients) {
  std::string path = filecache_path(file);
  std::string hidden = hidden_name(path);
  unlink(hidden.c_str());  // a leftover of a rewrite that crashed
  int fd = open(hidden.c_str(), O_CREAT | O_EXCL | O_WRONLY | O_CLOEXEC | O_NOFOLLOW, 0660);
  if (fd < 0) return errno;
  close(fd);
  CacheFile out = filecache_open(hidden, FileMode::append);
  if (!out) {
    unlink(hidden.c_str());
    return EIO;
  }
  std::string head = std::string(first_line) + "\r\n";
  for (const std::string& r : recipients) head += "RCPT TO:<" + r + ">\r\n";
  int rc = filecache_write(out, head);
  if (rc == 0 && filecache_copy(file, env.data_offset, out, kToEnd) != 0) rc = EIO;
  if (rc == 0) rc = filecache_sync(out);
  int close_rc = filecache_purge(out);
  if (rc == 0) rc = close_rc;
  if (rc == 0 && sysio::rename(hidden.c_str(), path.c_str()) != 0) rc = errno;
  if (rc != 0) {
    unlink(hidden.c_str());
    return rc;
  }
  // Should the folder sync fail, a crash may bring the old file back: its
  // recipients then get the message twice, and nobody loses it.
  return sync_parent_dir(path);
}

void queue_file_discard(CacheFile& file) {
  if (!file) return;
  std::string path = filecache_path(file);
  filecache_destroy(file);
  unreserve(path);
}

void queue_add_incoming(const std::string& path) { g_incoming.push_back(path); }

void queue_add_outgoing(const std::string& path) {
  for (const OutgoingEntry& e : g_outgoing)
    if (e.path == path) return;
  g_outgoing.push_back(outgoing_entry(path));
  note_outgoing_count();
}

void queue_scan_incoming() {
  g_incoming.clear();
  for (std::string& p : queue_files(incoming_dir())) g_incoming.push_back(std::move(p));
}

// Merges the folder into the list: new files are added, entries whose file
// has gone are dropped, unless a connection is sending them right now.
void queue_scan_outgoing() {
  std::vector<std::string> files = queue_files(outgoing_dir());
  for (auto it = g_outgoing.begin(); it != g_outgoing.end();) {
    bool present = std::find(files.begin(), files.end(), it->path) != files.end();
    if (!present && it->holder < 0) {
      it = g_outgoing.erase(it);
    } else {
      ++it;
    }
  }
  for (const std::string& p : files) {
    bool listed = std::any_of(g_outgoing.begin(), g_outgoing.end(),
                              [&](const OutgoingEntry& e) { return e.path == p; });
    if (!listed) g_outgoing.push_back(outgoing_entry(p));
  }
  note_outgoing_count();
}

const std::list<std::string>& queue_incoming() { return g_incoming; }
const std::list<OutgoingEntry>& queue_outgoing() { return g_outgoing; }
std::list<OutgoingEntry>& queue_outgoing_entries() { return g_outgoing; }

void queue_drop_outgoing(const std::string& path) {
  auto before = g_outgoing.size();
  g_outgoing.remove_if([&](const OutgoingEntry& e) { return e.path == path; });
  if (g_outgoing.size() != before) status_bits |= status::mail_queue_changed;
}

// A message half written when the suite stopped was never acknowledged;
// the counters start from the clock.
void queue_init(std::time_t now) {
  g_next_incoming = g_next_outgoing = static_cast<std::uint64_t>(now) * 10;
  remove_unfinished(incoming_dir());
  remove_unfinished(outgoing_dir());
}

std::optional<std::string> queue_pop_incoming() {
  if (g_incoming.empty()) return std::nullopt;
  std::string path = std::move(g_incoming.front());
  g_incoming.pop_front();
  return path;
}

// ---- addresses ------------------------------------------------------------------

std::optional<std::string> mail_local_user(std::string_view address) {
  address = line_cut(address);
  while (!address.empty() && (address.front() == '<' || address.front() == ':')) address.remove_prefix(1);
  std::size_t end = address.find_first_of(">@_ \t");
  std::string name(address.substr(0, end));
  if (name.empty()) return std::nullopt;
  std::string_view rest = end == std::string_view::npos ? std::string_view{} : address.substr(end);
  if (!rest.empty() && rest.front() == '_') {
    std::size_t at = rest.find_first_of("@> \t");
    rest = at == std::string_view::npos ? std::string_view{} : rest.substr(at);
  }
  if (!rest.empty() && rest.front() == '@') {
    std::string_view domain = rest.substr(1);
    domain = domain.substr(0, domain.find_first_of("> \t"));
    if (domain.empty() || !wildcard_match(domain, text_of(config.mail_domains))) return std::nullopt;
  }
  return name;
}

std::string mail_primary_domain() { return primary_mail_domain(); }

std::string mail_message_id(std::string_view header_name) {
  static unsigned long sequence = 0;
  std::string name = header_name.empty() ? std::string("Message-ID:") : std::string(header_name);
  return strprintf("%s <Velmor-%s-%ld.%ld@%s>\r\n", name.c_str(), kVersion, static_cast<long>(std::time(nullptr)),
                   static_cast<long>(std::clock()) + static_cast<long>(++sequence), mail_primary_domain().c_str());
}

// ---- the reject list -------------------------------------------------------------

int smtp_reject_load() {
  g_reject.clear();
  std::optional<std::string> text;
  if (!config.mail_file_smtpreject || !(text = read_text_file(*config.mail_file_smtpreject))) return 1;
  for_each_line(*text, [](std::string_view line) {
    if (!line.empty() && static_cast<unsigned char>(line.front()) > ' ')
      g_reject.emplace_back(line.substr(0, line.find_first_of(" \t")));
  });
  return 0;
}

// The first line of the file that matches decides: a pattern marked with
// '!' lets the sender through, any other refuses it.
bool smtp_reject_match(std::string_view sender) {
  for (const std::string& p : g_reject) {
    bool exception = p.front() == '!';
    std::string_view pattern = exception ? std::string_view(p).substr(1) : std::string_view(p);
    if (!pattern.empty() && wildcard_match(sender, pattern)) return !exception;
  }
  return false;
}

// ---- files ------------------------------------------------------------------------

std::string_view CacheSource::view(std::uint64_t offset, std::size_t want) {
  std::string_view v = filecache_view(file_, offset);
  if (v.size() >= want || v.empty()) return v;
  // The window ends early: join the next ones (each view lasts only until
  // the next call on the file).
  joined_.assign(v);
  while (joined_.size() < want) {
    std::string_view more = filecache_view(file_, offset + joined_.size());
    if (more.empty()) break;
    joined_ += more;
  }
  return joined_;
}

LineRead queue_read_line(ByteSource& in, std::uint64_t& offset, std::string& line, std::size_t max) {
  Line l = read_line(in, offset, max + 2);  // room for the CR LF
  line.clear();
  if (l.length == 0) return LineRead::end;
  offset += l.length;
  std::string_view body = l.text.size() == l.length ? line_body(l.text) : l.text;
  line.assign(body.substr(0, max));
  return l.text.size() == l.length && body.size() <= max ? LineRead::ok : LineRead::cut;
}

QueueEnvelope queue_read_envelope(ByteSource& in) {
  QueueEnvelope env;
  std::uint64_t offset = 0;
  LineRead got = queue_read_line(in, offset, env.first_line, kMaxEnvelopeLine);
  if (got == LineRead::end) return env;
  env.damaged = got == LineRead::cut;
  env.fetched = env.first_line.compare(0, 3, "POP") == 0;
  env.has_sender_bracket = env.first_line.find('<') != std::string::npos;
  std::string_view sender = envelope_address(env.first_line);
  if (sender.size() > kMaxAddress) env.damaged = true;
  env.sender = std::string(sender.substr(0, kMaxAddress));
  std::string line;
  for (;;) {
    std::uint64_t start = offset;
    got = queue_read_line(in, offset, line, kMaxEnvelopeLine);
    if (got == LineRead::end) break;
    if (!line.empty() && (line.front() == 'r' || line.front() == 'R')) {
      std::string_view address = envelope_address(line);
      if (got == LineRead::cut || address.size() > kMaxAddress) {
        env.damaged = true;
        continue;
      }
      env.recipients.emplace_back(address);
      continue;
    }
    if (!line.empty() && (line.front() == 'd' || line.front() == 'D')) {
      env.has_data = true;
      env.data_offset = start;
      env.body_offset = offset;
    } else {
      env.data_offset = env.body_offset = start;
    }
    break;
  }
  return env;
}

QueueEnvelope queue_read_envelope(CacheFile& file) {
  CacheSource in(file);
  return queue_read_envelope(in);
}

bool file_contains(CacheFile& file, const std::vector<std::string>& needles) {
  std::size_t longest = 0;
  for (const std::string& n : needles) longest = std::max(longest, n.size());
  if (longest == 0) return false;
  std::string window;  // the tail of the previous block, so a match across blocks is found
  std::uint64_t offset = 0;
  for (;;) {
    std::string_view v = filecache_view(file, offset);
    if (v.empty()) return false;
    window += v;
    for (const std::string& n : needles)
      if (!n.empty() && str_casestr(window, n)) return true;
    offset += v.size();
    if (window.size() >= longest) window.erase(0, window.size() - (longest - 1));
  }
}

bool mail_filter_match(std::string_view filter, const std::string& path) {
  std::vector<std::string> phrases = filter_phrases(filter);
  if (phrases.empty()) return false;
  CacheFile f = filecache_open(path, FileMode::read);
  if (!f) return false;
  bool found = file_contains(f, phrases);
  filecache_close(f);
  return found;
}

void mail_log(std::string_view line) { log_write(line, logchan::mail); }

void mail_move_to_oddments(const std::string& path, std::string_view reason) {
  std::string dir = oddments_dir();
  make_path(dir);
  long m = ((static_cast<long>(std::time(nullptr)) << 3) + (std::clock() & 7)) & 0x7fffffff;
  std::string target = path_join(dir, std::to_string(m));
  // Two moves in the same second must not overwrite each other.
  while (access(target.c_str(), F_OK) == 0) target = path_join(dir, std::to_string(++m));
  log_write(strprintf("%.*s: %s moved to %s", static_cast<int>(reason.size()), reason.data(), path.c_str(),
                      target.c_str()),
            logchan::errors);
  if (file_rename(path, target) != 0) {
    log_write("Mail queue: can't move " + path + " to oddments", logchan::errors);
    return;
  }
  mail_log(strprintf("Oddment: %s moved to %s: %.*s", path.c_str(), target.c_str(), static_cast<int>(reason.size()),
                     reason.data()));
}

// ---- error mails --------------------------------------------------------------------

std::string mail_body_lines(std::string_view text) {
  std::string out;
  bool line_start = true;
  for (std::size_t i = 0; i < text.size(); ++i) {
    char c = text[i];
    if (c == '\r' && i + 1 < text.size() && text[i + 1] == '\n') continue;
    if (c == '\n' || c == '\r') {
      out += "\r\n";
      line_start = true;
      continue;
    }
    if (line_start && c == '.') out += '.';
    out += c;
    line_start = false;
  }
  return out;
}

namespace {

// The reason an error mail gives, as one line for the mail log.
std::string first_text_line(std::string_view text) {
  std::string_view line = text.substr(0, text.find_first_of("\r\n"));
  return std::string(line.empty() ? std::string_view("(no reason given)") : line);
}

std::string about(const std::string& file) { return file.empty() ? std::string() : " about " + file; }

}  // namespace

ErrorMail send_error_mail(std::string_view text, std::string_view to, const std::string& file, bool headers_only) {
  std::string recipient(to);
  CacheFile source;
  QueueEnvelope env;
  if (!file.empty()) {
    source = filecache_open(file, FileMode::read);
    if (source) env = queue_read_envelope(source);
  }
  if (recipient.empty()) {
    if (file.empty()) {
      log_message("mail send_error: No 'to' address and no file", {}, logfac::house);
      return ErrorMail::skipped;
    }
    if (!source || !env.has_sender_bracket) {
      log_write("mail send_error: Invalid message file", logchan::errors);
      return ErrorMail::skipped;
    }
    recipient = env.sender;
  }
  // Never answer the null sender: that is how mail loops and backscatter start.
  if (recipient.empty() || recipient == "<>") {
    log_message("mail send_error: no error mail to the null sender", {}, logfac::maildebatch);
    mail_log("No error mail to the null sender" + about(file) + ": " + first_text_line(text));
    return ErrorMail::skipped;
  }
  if (source && (str_istarts_with(env.first_line, "X-Loop:") || file_contains(source, {"\nX-Loop:"}))) {
    filecache_close(source);
    mail_move_to_oddments(file, "mail send_error: Loop condition caught");
    return ErrorMail::moved;
  }
  CacheFile out = queue_create_incoming();
  if (!out) {
    if (source) {
      filecache_close(source);
      mail_move_to_oddments(file, "mail send_error: Can't open new incoming file");
      return ErrorMail::moved;
    }
    return ErrorMail::failed;
  }
  std::string admin = admin_address();
  std::string head;
  // From the null sender: a report about a report is never sent, so two
  // sites can never bounce mail to each other for ever.
  head += "MAIL FROM:<>\r\n";
  head += "RCPT TO:<" + recipient + ">\r\n";
  head += "DATA\r\n";
  head += "Date: " + mail_date_text(std::time(nullptr)) + "\r\n";
  head += "From: " + admin + "\r\n";
  head += "To: " + recipient + "\r\n";
  head += "Subject: Mail failure\r\n";
  head += mail_message_id();
  head += "Content-Type: text/plain\r\n";
  head += strprintf("X-Mailer: Velmor Server Suite v%s %s\r\n", kVersion, kPlatform);
  head += "X-Loop: 0\r\n\r\n";
  head += "An error occured whilst trying to send this mail.\r\n";
  head += mail_body_lines(text);
  int rc = 0;
  bool attached = source && env.has_data && !filecache_at_end(source, env.body_offset);
  if (attached) {
    head += "\r\n\r\n    ----- Unsent Message Follows -----\r\n\r\n";
    if (headers_only) {
      // The header lines as they are, however long, up to the empty line.
      CacheSource in(source);
      std::uint64_t end = env.body_offset, next = end;
      std::string line;
      for (LineRead got; (got = queue_read_line(in, next, line, 1)) != LineRead::end; end = next)
        if (line.empty() || (got == LineRead::ok && line == ".")) break;
      rc = filecache_write(out, head);
      if (rc == 0) rc = filecache_copy(source, env.body_offset, out, end - env.body_offset);
      if (rc == 0) rc = filecache_write(out, ".\r\n");
    } else {
      rc = filecache_write(out, head);
      if (rc == 0) rc = filecache_copy(source, env.body_offset, out, kToEnd);
      // A damaged file may lack its terminator; the error mail never does.
      std::uint64_t length = filecache_length(source);
      char tail[5] = {};
      if (rc == 0 && (length < env.body_offset + 5 || filecache_read(source, tail, length - 5, 5) != 5 ||
                      std::string_view(tail, 5) != "\r\n.\r\n"))
        rc = filecache_write(out, "\r\n.\r\n");
    }
  } else {
    if (head.size() < 2 || head.compare(head.size() - 2, 2, "\r\n") != 0) head += "\r\n";
    head += ".\r\n";
    rc = filecache_write(out, head);
  }
  if (source) filecache_close(source);
  std::string path = filecache_path(out);
  if (rc != 0) {
    filecache_destroy(out);
    unreserve(path);
    log_write("Mail queue: error mail could not be written: " + error_text(rc), logchan::errors);
    return ErrorMail::failed;
  }
  if ((rc = filecache_close(out)) != 0) {
    unreserve(path);
    log_write("Mail queue: error mail could not be written: " + error_text(rc), logchan::errors);
    return ErrorMail::failed;
  }
  queue_add_incoming(path);
  mail_log("Error mail to " + recipient + about(file) + ": " + first_text_line(text));
  return ErrorMail::sent;
}

void mail_send_error(std::string_view text, std::string_view to, const std::string& file) {
  send_error_mail(text, to, file);
}

void mail_send_refusal(std::string_view text, std::string_view to, const std::string& file) {
  send_error_mail(text, to, file, true);
}

}  // namespace velmor
