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
  // One value per option of the table, in table order (unset when absent);
  // sizes are held in bytes. Read them through the accessors below.
  std::vector<std::optional<std::string>> values;
  std::vector<std::uint32_t> sizes;
  std::uint32_t mail_flags = 0, news_flags = 0, proxy_flags = 0, web_flags = 0, misc_flags = 0;

  // The value of a string/permission/list option ("" when unset).
  const std::string& text(std::string_view key) const;
  bool has(std::string_view key) const;    // a string option is set
  std::uint32_t size(std::string_view key) const;  // bytes, 0 = no limit
  // The permission rule for a permission option at `now` (server_now when 0).
  bool permits(std::string_view key, std::time_t now = 0) const;
};

int groups_load(const std::string& path);  // 0; 1 cannot open; 2 no memory
int groups_save();                          // 0 or non-zero on a failed write
// With a value: sets the key (unknown keys ignored). Without: the written form.
void group_option(GroupOptions& set, std::string_view key, std::string_view value);
std::optional<std::string> group_option(const GroupOptions& set, std::string_view key);
void group_copy(const GroupOptions& from, GroupOptions& to);
std::shared_ptr<const GroupOptions> group_find(int number);  // nullptr when none
std::shared_ptr<const GroupOptions> group_default();         // first set, or nullptr
const std::vector<std::shared_ptr<GroupOptions>>& group_list();
GroupOptionKind group_option_kind(std::string_view key);

}  // namespace velmor
