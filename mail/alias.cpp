#include "mail/alias.h"

#include <cstdlib>
#include <unordered_map>

#include "core/config.h"
#include "core/filecache.h"
#include "core/log.h"
#include "core/textfile.h"
#include "core/util.h"
#include "mail/queue.h"
#include "mail/queue_text.h"

namespace velmor {

namespace {

bool is_separator(char c) { return c == ' ' || c == '\t' || c == ','; }

// Nesting levels allowed, and the work one recipient may cause in all (a
// table whose aliases fan out to each other must not stall the suite).
constexpr int kMaxDepth = 10;
constexpr int kMaxSteps = 10000;

// The window of a timed target, "[HH:MM-HH:MM]...", each end packed as
// hour * 256 + minute. Every number counts modulo 256 however many digits
// it has, so no text can overflow it.
bool parse_window(std::string_view text, int& start, int& end) {
  std::size_t i = 1;
  int n[4] = {};
  for (int k = 0; k < 4; ++k) {
    if (k > 0 && (i >= text.size() || text[i++] != ":-:"[k - 1])) return false;
    std::size_t first = i;
    for (; i < text.size() && text[i] >= '0' && text[i] <= '9'; ++i) n[k] = (n[k] * 10 + (text[i] - '0')) % 256;
    if (i == first) return false;
  }
  start = (n[0] << 8) | n[1];
  end = (n[2] << 8) | n[3];
  return true;
}

struct Resolver {
  const std::vector<AliasEntry>& table;
  AliasSink& sink;
  int steps = 0;
  bool looped = false;
  // The entry each recipient met so far resolves through: a fan-out meets
  // the same names again and again, and every fresh lookup scans the table
  // (thousands of steps through a long table stalled the suite for seconds).
  std::unordered_map<std::string, const AliasEntry*> found;

  const AliasEntry* lookup(std::string_view recipient) {
    auto [it, fresh] = found.try_emplace(std::string(recipient), nullptr);
    if (fresh) {
      for (const AliasEntry& e : table) {
        if (wildcard_match(recipient, e.name)) {
          it->second = &e;
          break;
        }
      }
    }
    return it->second;
  }

  void report_loop() {
    if (!looped) sink.loop_report();
    looped = true;
  }

  // Sends to a target that no alias took: a local user's mailbox, or out.
  bool deliver_plain(std::string_view target) {
    if (target.find('@') == std::string_view::npos) {
      if (sink.user_exists(target)) return sink.deliver_local(target, target);
      log_message("Aliasing: user does not exist: ", target, logfac::maildebatch);
      return false;
    }
    sink.deliver_remote(target);
    return true;
  }

  bool resolve(std::string_view recipient, int depth) {
    if (recipient.empty()) return false;
    if (str_iequals(recipient, "nobody")) return true;
    if (recipient.size() > 1 && recipient.front() == '+' &&
        recipient.find_first_not_of("0123456789", 1) == std::string_view::npos) {
      return sink.deliver_group(std::atoi(std::string(recipient.substr(1)).c_str()));
    }
    if (++steps > kMaxSteps) {
      report_loop();
      return false;
    }
    const AliasEntry* entry = lookup(recipient);
    if (!entry) return false;
    if (++depth > kMaxDepth) {
      report_loop();
      return false;
    }
    bool handled = false;
    for (const AliasTarget& t : entry->targets) {
      if (looped) break;
      switch (t.kind) {
        case AliasKind::local:
          if (resolve(t.text, depth) || deliver_plain(t.text)) handled = true;
          break;
        case AliasKind::timed: {
          std::size_t close = t.text.find(']');
          int start = 0, end = 0;
          if (close == std::string::npos || !parse_window(t.text, start, end)) break;
          std::tm now = sink.local_time();
          if (!time_in_window(now, start, end)) break;
          handled = true;
          std::string_view rest = std::string_view(t.text).substr(close + 1);
          if (!resolve(rest, depth)) deliver_plain(rest);
          break;
        }
        case AliasKind::remote:
          handled = true;
          if (!resolve(t.text, depth)) sink.deliver_remote(t.text);
          break;
        case AliasKind::list: {
          std::vector<std::string> lines;
          if (!sink.read_list(t.text, lines)) {
            log_write("Mail alias: can't read list file " + t.text, logchan::errors);
            break;
          }
          for (const std::string& raw : lines) {
            if (looped) break;
            std::string_view line = trim_blanks(line_cut(raw));
            if (line.empty()) continue;
            if (line.size() > kMaxAddress) line = line.substr(0, kMaxAddress);
            handled = true;
            bool forced_remote = line.front() == '%';
            if (forced_remote) line.remove_prefix(1);
            std::string user = forced_remote ? std::string() : sink.local_user(line);
            if (user.empty()) {
              log_message("Mail list external user check:", line, logfac::maildebatch);
              if (!resolve(line, depth)) sink.deliver_remote(line);
              continue;
            }
            log_message("Mail list local user check:", line, logfac::maildebatch);
            if (resolve(user, depth)) continue;
            if (!sink.user_exists(user) || !sink.deliver_local(user, line)) sink.deliver_remote(line);
          }
          break;
        }
        case AliasKind::file:
          if (sink.deliver_file(t.text)) handled = true;
          break;
      }
    }
    return handled;
  }
};

std::vector<AliasEntry> g_table;

}  // namespace

AliasTarget alias_parse_target(std::string_view text) {
  AliasTarget t;
  if (!text.empty() && text.front() == '!') {
    t.bang = true;
    text.remove_prefix(1);
  }
  if (!text.empty() && text.front() == '[') {
    t.kind = AliasKind::timed;
  } else if (!text.empty() && text.front() == '#') {
    t.kind = AliasKind::file;
    text.remove_prefix(1);
  } else if (text.find('@') != std::string_view::npos) {
    t.kind = AliasKind::remote;
  } else if (text.find('$') != std::string_view::npos) {
    t.kind = AliasKind::list;
  }
  t.text = text;
  return t;
}

bool alias_parse_line(std::string_view line, AliasEntry& entry) {
  line = line_cut(line);
  if (line.empty()) return false;
  char first = line.front();
  if (first == '|' || first == '#' || first == ' ' || first == '\t') return false;
  std::size_t sep = 0;
  while (sep < line.size() && !is_separator(line[sep])) ++sep;
  if (sep == line.size()) return false;
  entry.name = line.substr(0, sep);
  entry.targets.clear();
  std::size_t pos = sep;
  while (pos < line.size()) {
    while (pos < line.size() && is_separator(line[pos])) ++pos;
    std::size_t end = pos;
    while (end < line.size() && !is_separator(line[end])) ++end;
    if (end > pos) entry.targets.push_back(alias_parse_target(line.substr(pos, end - pos)));
    pos = end;
  }
  return !entry.targets.empty();
}

std::string alias_entry_text(const AliasEntry& entry) {
  std::string out = entry.name;
  for (const AliasTarget& t : entry.targets) {
    out += ',';
    if (t.bang) out += '!';
    if (t.kind == AliasKind::file) out += '#';
    out += t.text;
  }
  out += '\n';
  return out;
}

std::vector<AliasEntry> alias_parse(std::string_view file_text) {
  std::vector<AliasEntry> table;
  for_each_line(file_text, [&](std::string_view line) {
    AliasEntry entry;
    if (alias_parse_line(line, entry)) table.push_back(std::move(entry));
  });
  return table;
}

std::vector<AliasEntry>& alias_table() { return g_table; }

bool alias_resolve(const std::vector<AliasEntry>& table, std::string_view recipient, AliasSink& sink) {
  Resolver r{table, sink, 0, false, {}};
  return r.resolve(recipient, 0);
}

int alias_load() {
  g_table.clear();
  std::optional<std::string> text;
  if (!config.mail_file_alias || !(text = read_text_file(*config.mail_file_alias))) return 1;
  g_table = alias_parse(*text);
  return 0;
}

int alias_save() {
  if (!config.mail_file_alias) return 1;
  std::string text;
  for (const AliasEntry& e : g_table) text += alias_entry_text(e);
  return file_write_atomic(*config.mail_file_alias, text, true);
}

}  // namespace velmor
