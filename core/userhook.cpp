// The user-change hook: every change of the user database is noted as a
// line in file.user.changes, and file.user.exec is told about it.
#include <fcntl.h>
#include <unistd.h>

#include "core/config.h"
#include "core/filecache.h"
#include "core/log.h"
#include "core/process.h"
#include "core/strfmt.h"
#include "core/util.h"

namespace velmor {

void user_change_note(std::string_view line) {
  const std::string& changes = text_of(config.file_user_changes);
  if (changes.empty()) return;
  // The file lists accounts: it is made private before anything goes in.
  if (int fd = ::open(changes.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600); fd >= 0) ::close(fd);
  std::string text(line);
  for (char& c : text) {
    if (c == '\r' || c == '\n') c = ' ';  // one change, one line
  }
  text += '\n';
  CacheFile file = filecache_open(changes, FileMode::append);
  int err = file ? filecache_write(file, text) : EIO;
  if (file) err = err ? (filecache_abandon(file), err) : filecache_close(file);
  if (err) log_message("Couldn't note a user change in ", changes, logfac::house);
  const std::string& exec = text_of(config.file_user_exec);
  if (!exec.empty()) run_shell(strprintf("Filer_Run %s %s", exec.c_str(), changes.c_str()));
}

}  // namespace velmor
