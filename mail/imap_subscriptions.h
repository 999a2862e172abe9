// A user's IMAP subscriptions, kept in mail/.subscriptions below the home:
// one name a line, in the order subscribed. SUBSCRIBE appends its name and
// UNSUBSCRIBE appends the name behind a "~" (no mailbox name starts with
// one), so neither rewrites the file; it is rewritten whole, synced and
// renamed into place, when such lines outnumber the names, and when RENAME
// or DELETE carry names along. A session keeps what it read and reads the
// file again only when it changed (another session of the user wrote it).
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

// The names a subscriptions file holds, in order: its lines applied one by
// one ("~name" takes a name out). Names that are not allowed, repeats and a
// cut last line are dropped. `lines` (when given) learns how many lines were
// read. imap_subscriptions_text writes names back in the same form.
std::vector<std::string> imap_subscriptions_parse(std::string_view text, std::size_t* lines = nullptr);
std::string imap_subscriptions_text(const std::vector<std::string>& names);

class Subscriptions {
 public:
  explicit Subscriptions(std::string home) : home_(std::move(home)) {}
  // The names subscribed to, oldest first.
  const std::vector<std::string>& names();
  // 0, or an errno value (E2BIG: the file has no room for more names).
  int add(const std::string& name);
  // 0, ENOENT when the name is not subscribed, or an errno value.
  int remove(const std::string& name);
  // A mailbox or folder renamed (to `to`) or deleted (no `to`): its name and
  // the names below it follow. 0 or an errno value.
  int carry(std::string_view from, std::optional<std::string_view> to);

 private:
  struct Stamp {
    dev_t device = 0;
    ino_t inode = 0;
    off_t size = 0;
    std::time_t seconds = 0;
    long nanoseconds = 0;
    bool operator==(const Stamp&) const = default;
  };
  void refresh();
  int append(std::string_view line);
  int rewrite(const std::vector<std::string>& names);

  std::string home_;
  std::vector<std::string> names_;
  std::size_t lines_ = 0;
  std::optional<Stamp> stamp_;  // of the file last read or written; none: no file
  bool read_ = false;
};

}  // namespace velmor
