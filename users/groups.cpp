// Group option sets and the groups file.
#include "users/groups.h"

#include <charconv>
#include <cstdio>
#include <cstring>
#include <limits>
#include <new>
#include <unordered_map>

#include "core/config.h"
#include "core/filecache.h"
#include "core/log.h"
#include "core/strfmt.h"
#include "core/textfile.h"
#include "core/util.h"

namespace velmor {

namespace {

enum FlagWord { mail_word, news_word, proxy_word, web_word, misc_word, no_word };

struct OptionInfo {
  std::string_view key;
  GroupOptionKind kind;
  FlagWord word = no_word;
  std::uint32_t bit = 0;
};

using K = GroupOptionKind;

// Every option, in the order the file is written.
constexpr OptionInfo kOptions[] = {
    {"group.name", K::string},
    {"mail.address.send.block", K::list},
    {"mail.address.send.allow", K::list},
    {"mail.address.recv.block", K::list},
    {"mail.address.recv.allow", K::list},
    {"mail.block.redirect", K::string},
    {"mail.msg.size", K::size},
    {"mail.large.redirect", K::string},
    {"mail.box.size", K::size},
    {"mail.box.warn", K::size},
    {"mail.dir.size", K::size},
    {"mail.dir.warn", K::size},
    {"mail.pop.fetch", K::permission},
    {"mail.imap.fetch", K::permission},
    {"mail.smtp.send", K::permission},
    {"mail.web.fetch", K::permission},
    {"mail.web.send", K::permission},
    {"mail.web.headers", K::string},
    {"mail.web.templates", K::string},
    {"mail.web.sigfile", K::string},
    {"mail.filter", K::string},
    {"mail.filter.redirect", K::string},
    {"mail.web.headers.own", K::flag, mail_word, gflag::mail_web_headers_own},
    {"mail.web.sig.own", K::flag, mail_word, gflag::mail_web_sig_own},
    {"mail.web.templates.own", K::flag, mail_word, gflag::mail_web_templates_own},
    {"mail.web.taglines", K::flag, mail_word, gflag::mail_web_taglines},
    {"mail.forward", K::flag, mail_word, gflag::mail_forward},
    {"mail.vacation", K::flag, mail_word, gflag::mail_vacation},
    {"mail.override", K::flag, mail_word, gflag::mail_override},
    {"news.nntp.read", K::permission},
    {"news.nntp.post", K::permission},
    {"news.anon.post", K::flag, news_word, gflag::news_anon_post},
    {"news.web.read", K::permission},
    {"news.web.post", K::permission},
    {"news.groups.read", K::string},
    {"news.groups.post", K::string},
    {"news.filter", K::string},
    {"news.web.headers", K::string},
    {"news.web.templates", K::string},
    {"news.web.sigfile", K::string},
    {"news.web.sig.own", K::flag, news_word, gflag::news_web_sig_own},
    {"news.web.headers.own", K::flag, news_word, gflag::news_web_headers_own},
    {"news.web.templates.own", K::flag, news_word, gflag::news_web_templates_own},
    {"news.active.add", K::flag, news_word, gflag::news_active_add},
    {"proxy.web.local.access", K::permission},
    {"proxy.web.http.access", K::permission},
    {"proxy.web.ftp.access", K::permission},
    {"proxy.web.gopher.access", K::permission},
    {"proxy.telnet.access", K::permission},
    {"proxy.dynamic.access", K::flag, proxy_word, gflag::proxy_dynamic_access},
    {"proxy.spoof", K::string},
    {"proxy.socks", K::permission},
    {"proxy.raudio", K::permission},
    {"proxy.external.access", K::permission},
    {"proxy.filter", K::string},
    {"proxy.filter.note", K::flag, proxy_word, gflag::proxy_filter_note},
    {"proxy.url_allow.file", K::string},
    {"proxy.url_block.file", K::string},
    {"proxy.log", K::flag, proxy_word, gflag::proxy_log},
    {"proxy.cache", K::flag, proxy_word, gflag::proxy_cache},
    {"web.access", K::permission},
    {"web.cgi", K::flag, web_word, gflag::web_cgi},
    {"misc.execcmds", K::flag, misc_word, gflag::misc_execcmds},
    {"misc.ftpsu", K::flag, misc_word, gflag::misc_ftpsu},
    {"misc.config", K::flag, misc_word, gflag::misc_config},
    {"misc.desklock", K::flag, misc_word, gflag::misc_desklock},
    {"misc.dialin", K::flag, misc_word, gflag::misc_dialin},
    {"misc.telnet.shell", K::string},
    {"misc.default.dir", K::string},
};
constexpr std::size_t kOptionCount = std::size(kOptions);

constexpr std::uint32_t GroupOptions::*kFlagWords[] = {
    &GroupOptions::mail_flags, &GroupOptions::news_flags, &GroupOptions::proxy_flags,
    &GroupOptions::web_flags, &GroupOptions::misc_flags};

bool holds_text(GroupOptionKind kind) {
  return kind == K::string || kind == K::permission || kind == K::list;
}

// The table index of a key, or -1. Services pass the keys in lower case, so
// the exact map answers them; other spellings fall back to a scan.
int option_index(std::string_view key) {
  static const auto exact = [] {
    std::unordered_map<std::string_view, int> map;
    for (std::size_t i = 0; i < kOptionCount; ++i) map.emplace(kOptions[i].key, static_cast<int>(i));
    return map;
  }();
  if (auto it = exact.find(key); it != exact.end()) return it->second;
  for (std::size_t i = 0; i < kOptionCount; ++i) {
    if (str_iequals(kOptions[i].key, key)) return static_cast<int>(i);
  }
  return -1;
}

// The stored text of a string, permission or list option, or nullptr.
const std::optional<std::string>* text_slot(const GroupOptions& set, std::string_view key) {
  int i = option_index(key);
  if (i < 0 || !holds_text(kOptions[i].kind) || static_cast<std::size_t>(i) >= set.values.size()) {
    return nullptr;
  }
  return &set.values[static_cast<std::size_t>(i)];
}

// "100" -> 100; digits after optional blanks, anything else is 0 (no limit).
std::uint64_t parse_kilobytes(std::string_view value) {
  constexpr std::uint64_t kMax = std::numeric_limits<std::uint64_t>::max() / 1024;
  value = trim_blanks(value);
  std::uint64_t kb = 0;
  auto result = std::from_chars(value.data(), value.data() + value.size(), kb);
  if (result.ec == std::errc::result_out_of_range) return kMax;
  return result.ec == std::errc() ? std::min(kb, kMax) : 0;
}

struct GroupList {
  std::vector<std::shared_ptr<GroupOptions>> sets;
  std::string path;
};

GroupList& groups() {
  static GroupList g;
  return g;
}

// "#12" (blanks allowed after "#", text after the number ignored): the number.
// A "#" line without a number is a comment.
std::optional<int> group_line_number(std::string_view line) {
  std::string_view rest = trim_blanks(line.substr(1));
  if (!rest.empty() && rest[0] == '+') rest.remove_prefix(1);
  int number = 0;
  auto [end, ec] = std::from_chars(rest.data(), rest.data() + rest.size(), number);
  if (ec != std::errc() || end == rest.data()) return std::nullopt;
  return number;
}

std::string_view drop_leading_blanks(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size() && (text[i] == ' ' || text[i] == '\t')) ++i;
  return text.substr(i);
}

}  // namespace

const std::string& GroupOptions::text(std::string_view key) const {
  static const std::string empty;
  const std::optional<std::string>* slot = text_slot(*this, key);
  return slot && *slot ? **slot : empty;
}

bool GroupOptions::has(std::string_view key) const {
  const std::optional<std::string>* slot = text_slot(*this, key);
  return slot && slot->has_value();
}

std::uint32_t GroupOptions::size(std::string_view key) const {
  int i = option_index(key);
  if (i < 0 || kOptions[i].kind != K::size || static_cast<std::size_t>(i) >= sizes_kb.size()) {
    return 0;
  }
  std::uint64_t bytes = sizes_kb[static_cast<std::size_t>(i)] * 1024;
  return static_cast<std::uint32_t>(std::min<std::uint64_t>(bytes, 0xffffffffu));
}

bool GroupOptions::flag(std::string_view key) const {
  int i = option_index(key);
  if (i < 0 || kOptions[i].kind != K::flag) return false;
  return (this->*kFlagWords[kOptions[i].word] & kOptions[i].bit) != 0;
}

bool GroupOptions::permits(std::string_view key, std::time_t now) const {
  int i = option_index(key);
  if (i < 0 || kOptions[i].kind != K::permission) return false;
  const std::optional<std::string>* slot = text_slot(*this, key);
  return access_granted(slot && *slot ? std::string_view(**slot) : std::string_view(), now);
}

bool group_option(GroupOptions& set, std::string_view key, std::string_view value) {
  int i = option_index(key);
  if (i < 0 || value.find_first_of(std::string_view("\r\n\0", 3)) != std::string_view::npos) {
    return false;
  }
  value = drop_leading_blanks(value);
  const OptionInfo& info = kOptions[i];
  auto slot = static_cast<std::size_t>(i);
  switch (info.kind) {
    case K::size:
      set.sizes_kb.resize(kOptionCount);
      set.sizes_kb[slot] = parse_kilobytes(value);
      break;
    case K::flag:
      bits_set(set.*kFlagWords[info.word], info.bit, yes_no_word(value) != 0);
      break;
    default:
      set.values.resize(kOptionCount);
      set.values[slot] = std::string(value);
      break;
  }
  return true;
}

std::optional<std::string> group_option(const GroupOptions& set, std::string_view key) {
  int i = option_index(key);
  if (i < 0) return std::nullopt;
  const OptionInfo& info = kOptions[i];
  auto slot = static_cast<std::size_t>(i);
  switch (info.kind) {
    case K::size:
      return std::to_string(slot < set.sizes_kb.size() ? set.sizes_kb[slot] : 0);
    case K::flag:
      return std::string((set.*kFlagWords[info.word] & info.bit) ? "yes" : "no");
    default:
      return slot < set.values.size() && set.values[slot] ? *set.values[slot] : std::string();
  }
}

void group_copy(const GroupOptions& from, GroupOptions& to) {
  int number = to.number;
  to = from;
  to.number = number;
}

int groups_load(const std::string& path) {
  GroupList& g = groups();
  g.path = path;
  g.sets.clear();
  try {
    std::optional<std::string> text = path.empty() ? std::nullopt : read_text_file(path);
    if (!text) return 1;
    return groups_parse(*text);
  } catch (const std::bad_alloc&) {
    return 2;
  }
}

int groups_parse(std::string_view file_text) {
  GroupList& g = groups();
  g.sets.clear();
  std::vector<std::shared_ptr<GroupOptions>> sets;
  // A key's value is applied when the next key line, group line or the end of
  // the file is reached, so continuation lines can extend it first.
  std::optional<std::string> key;
  std::string value;
  auto apply = [&] {
    if (key && !sets.empty() && !group_option(*sets.back(), *key, value) &&
        option_index(*key) >= 0) {
      log_message("Group option value refused: ", *key);
    }
    key.reset();
  };
  auto read_line = [&](std::string_view text) {
    if (text.empty() || text[0] == '|') return;
    if (text[0] == '#') {
      if (auto number = group_line_number(text)) {
        apply();
        sets.push_back(std::make_shared<GroupOptions>());
        sets.back()->number = *number;
      }
      return;  // a "#" without a number is a comment
    }
    if (text[0] == '%') {
      apply();
      if (sets.empty()) return;  // a key before the first group
      std::size_t colon = text.find(':');
      key = std::string(trim_blanks(text.substr(1, colon == std::string_view::npos ? colon : colon - 1)));
      value = colon == std::string_view::npos ? std::string()
                                               : std::string(drop_leading_blanks(text.substr(colon + 1)));
      return;
    }
    std::string_view more = drop_leading_blanks(text);
    if (!key || more.empty()) return;
    if (!value.empty()) value += ',';
    value += more;
  };
  try {
    for_each_line(file_text, read_line);
    apply();
  } catch (const std::bad_alloc&) {
    g.sets = std::move(sets);  // the sets read so far stay
    return 2;
  }
  g.sets = std::move(sets);
  return 0;
}

std::string groups_text() {
  std::string text;
  for (const auto& set : groups().sets) {
    strappendf(text, "#%d\n", set->number);
    for (std::size_t i = 0; i < kOptionCount; ++i) {
      // An unset text option is left out, so it reloads unset rather than
      // as an empty value.
      if (holds_text(kOptions[i].kind) && (i >= set->values.size() || !set->values[i])) continue;
      std::string_view key = kOptions[i].key;
      text += '%';
      text += key;
      text += ": ";
      text += *group_option(*set, key);
      text += '\n';
    }
  }
  return text;
}

int groups_save() {
  GroupList& g = groups();
  if (g.path.empty()) return ENOENT;
  int err = file_write_atomic(g.path, groups_text(), true, 0600);
  if (err != 0) log_message("Couldn't save user group file: ", g.path + ": " + std::strerror(err));
  return err;
}

std::shared_ptr<const GroupOptions> group_find(int number) {
  for (const auto& set : groups().sets) {
    if (set->number == number) return set;
  }
  return nullptr;
}

std::shared_ptr<const GroupOptions> group_default() {
  const auto& sets = groups().sets;
  return sets.empty() ? nullptr : sets.front();
}

const std::vector<std::shared_ptr<GroupOptions>>& group_list() { return groups().sets; }

GroupOptionKind group_option_kind(std::string_view key) {
  int i = option_index(key);
  return i < 0 ? K::string : kOptions[i].kind;
}

const std::vector<std::string_view>& group_option_keys() {
  static const std::vector<std::string_view> keys = [] {
    std::vector<std::string_view> out;
    for (const OptionInfo& info : kOptions) out.push_back(info.key);
    return out;
  }();
  return keys;
}

}  // namespace velmor
