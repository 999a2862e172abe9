// Group option sets: what the members of each numbered group may do in every
// service. Loaded from the groups file at start-up and on "reload groups";
// the first set is the default group. Sets are shared: a reload makes new
// sets, and a live connection keeps the set it started with.
#pragma once

#include <cstdint>
#include <ctime>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

enum class GroupOptionKind { string, size, flag, permission, list };

// Flag bits, each within its word.
namespace gflag {
inline constexpr std::uint32_t mail_web_sig_own = 0x02, mail_web_taglines = 0x04,
    mail_web_headers_own = 0x08, mail_web_templates_own = 0x10, mail_forward = 0x40,
    mail_vacation = 0x80, mail_override = 0x40000000;
inline constexpr std::uint32_t news_active_add = 0x02, news_web_sig_own = 0x04,
    news_web_headers_own = 0x08, news_web_templates_own = 0x10, news_anon_post = 0x20;
inline constexpr std::uint32_t proxy_filter_note = 0x02, proxy_log = 0x04, proxy_cache = 0x08,
    proxy_dynamic_access = 0x10;
inline constexpr std::uint32_t web_cgi = 0x02;
inline constexpr std::uint32_t misc_execcmds = 0x02, misc_ftpsu = 0x04, misc_config = 0x08,
    misc_desklock = 0x10, misc_dialin = 0x20;
}  // namespace gflag

struct GroupOptions {
  int number = 0;
  // By option index: the text of string, permission and list options (unset
  // when absent) and the size options in kilobytes as written. A set made
  // with no options reads as all unset. Read them through the accessors.
  std::vector<std::optional<std::string>> values;
  std::vector<std::uint64_t> sizes_kb;
  std::uint32_t mail_flags = 0, news_flags = 0, proxy_flags = 0, web_flags = 0, misc_flags = 0;

  // The value of a string/permission/list option ("" when unset).
  const std::string& text(std::string_view key) const;
  bool has(std::string_view key) const;    // a string option is set
  // Bytes, 0 = no limit; a limit past 4 GiB reads as 0xffffffff.
  std::uint32_t size(std::string_view key) const;
  bool flag(std::string_view key) const;   // a flag option is on
  // The permission rule for a permission option at `now` (server_now when 0).
  // A key that is not a permission option refuses.
  bool permits(std::string_view key, std::time_t now = 0) const;
};

// The permission rule for a connection's or a user's set: a missing set (no
// groups file) refuses everything.
inline bool group_permits(const std::shared_ptr<const GroupOptions>& set, std::string_view key,
                          std::time_t now = 0) {
  return set && set->permits(key, now);
}

// Replaces the list with the file's sets. A missing file leaves no sets at
// all (no default group). 0; 1 cannot open; 2 no memory.
int groups_load(const std::string& path);
// What groups_load does with the file's text: replaces the list with its
// sets (the file groups_save writes is unchanged). 0; 2 no memory.
int groups_parse(std::string_view text);
// The text groups_save writes for the list.
std::string groups_text();
// Writes the list to the file it was loaded from (temporary name, fsync,
// rename; the old file kept as <file>~). 0, or an errno value when the file
// could not be written, the old file then left as it was.
int groups_save();
// With a value: sets the key. False for an unknown key or a value holding a
// CR, LF or NUL (which the file cannot carry); the set is then unchanged.
// Leading blanks and tabs of the value are dropped, as the file reader does.
bool group_option(GroupOptions& set, std::string_view key, std::string_view value);
// Without: the written form (string, size in kilobytes, "yes"/"no"; "" for an
// unset string); nothing for an unknown key.
std::optional<std::string> group_option(const GroupOptions& set, std::string_view key);
void group_copy(const GroupOptions& from, GroupOptions& to);
std::shared_ptr<const GroupOptions> group_find(int number);  // nullptr when none
std::shared_ptr<const GroupOptions> group_default();         // first set, or nullptr
const std::vector<std::shared_ptr<GroupOptions>>& group_list();
// The kind of an option (string for an unknown key).
GroupOptionKind group_option_kind(std::string_view key);
// Every option key in the order the file is written.
const std::vector<std::string_view>& group_option_keys();

}  // namespace velmor
