// Files below a folder whose contents someone else controls, such as a
// user's home while the suite runs as root. The folder itself is trusted
// (its path comes from the administrator); below it every step is taken
// from the descriptor of the folder above with O_NOFOLLOW, so a planted
// symbolic link is never followed, and every folder and file reached must
// belong to the trusted folder's owner or to the suite. A file with a
// second name (a hard link to a file elsewhere) is refused too, and special
// files are never waited on.
#pragma once

#include <sys/types.h>

#include <string>
#include <string_view>

#include "core/fileio.h"

namespace velmor {

enum class SafeStatus {
  ok,
  missing,      // a step does not exist
  link,         // a step is a symbolic link
  wrong_type,   // a file where a folder belongs, or a folder or special file where a file belongs
  foreign,      // owned by another user than the folder's owner or the suite
  hard_linked,  // a file with more than one name
  failed,       // any other failure (`error` tells)
};

struct SafeResult {
  SafeStatus status = SafeStatus::ok;
  int error = 0;      // an errno value for every status but ok
  std::string where;  // the steps up to the one that failed ("mail/inbox")
  bool ok() const { return status == SafeStatus::ok; }
  // Something below the folder is not what it must be (as opposed to
  // missing, or a failure of the system).
  bool refused() const;
};

// "<root>/<where> is a symbolic link" and the like, for log lines.
std::string safe_describe(std::string_view root, const SafeResult& result);

class SafeDir {
 public:
  // Opens the trusted folder by its path (links along that path are
  // followed); its owner is the user whose files lie below it.
  static SafeResult open_root(const std::string& path, SafeDir& out);

  // The folder `rel` ("a" or "a/b") below this one; missing folders are
  // made (mode 0700) when `create`. "." and ".." steps are refused.
  SafeResult open_dir(std::string_view rel, bool create, SafeDir& out) const;
  // The regular file `rel` below this one, opened with `flags` (O_RDONLY,
  // O_RDWR | O_CREAT, ...; O_TRUNC is ignored, as it would act before the
  // file is checked). A new file gets `mode`; folders are not made.
  SafeResult open_file(std::string_view rel, int flags, UniqueFd& out, mode_t mode = 0600) const;
  // Whether anything (a link too) has the name `name` in this folder.
  bool has(std::string_view name) const;
  // Makes the new file `name` in this folder (O_EXCL); a stale one of that
  // name, left by a crash, is removed first.
  SafeResult create_new(std::string_view name, mode_t mode, UniqueFd& out) const;
  // Replaces the file `name` with `data` durably: a new file is written and
  // synced, renamed over the old one, and the folder synced, so a crash
  // leaves the old file or the new one. 0 or an errno value.
  int replace_file(std::string_view name, std::string_view data, mode_t mode = 0600) const;
  // Renames within this folder (through the sysio seam). 0 or an errno value.
  int rename(std::string_view from, std::string_view to) const;
  // Syncs the folder, so names made or renamed in it last. 0 or an errno value.
  int sync() const;
  void remove(std::string_view name) const;

  int fd() const { return fd_.get(); }
  explicit operator bool() const { return static_cast<bool>(fd_); }

 private:
  UniqueFd fd_;
  uid_t owner_ = 0;
};

}  // namespace velmor
