#include "mail/imap_subscriptions.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "core/fileio.h"
#include "core/safedir.h"
#include "mail/imap_server.h"

namespace velmor {

namespace {

constexpr std::string_view kFolder = "mail";
constexpr std::string_view kFile = ".subscriptions";
// The most of the file that is read, and the most its names may take (the
// lines that compaction removes take the rest).
constexpr std::size_t kFileBytes = 1024 * 1024;
constexpr std::size_t kNamesBytes = kFileBytes / 4;
// Lines beyond twice the names (and this many) are compacted away.
constexpr std::size_t kSlack = 64;

bool subscribable(std::string_view name) { return name == "INBOX" || imap_name_allowed(name); }

std::size_t text_size(const std::vector<std::string>& names) {
  std::size_t n = 0;
  for (const std::string& name : names) n += name.size() + 1;
  return n;
}

}  // namespace

std::vector<std::string> imap_subscriptions_parse(std::string_view text, std::size_t* lines) {
  std::vector<std::string> names;
  std::size_t count = 0;
  for (std::size_t from = 0; from < text.size();) {
    std::size_t nl = text.find('\n', from);
    if (nl == std::string_view::npos) break;  // a cut last line is not a name
    std::string_view line = text.substr(from, nl - from);
    from = nl + 1;
    ++count;
    bool drop = !line.empty() && line.front() == '~';
    if (drop) line.remove_prefix(1);
    if (!subscribable(line)) continue;
    auto it = std::find(names.begin(), names.end(), line);
    if (drop && it != names.end()) names.erase(it);
    if (!drop && it == names.end()) names.emplace_back(line);
  }
  if (lines) *lines = count;
  return names;
}

std::string imap_subscriptions_text(const std::vector<std::string>& names) {
  std::string text;
  for (const std::string& n : names) text += n + "\n";
  return text;
}

void Subscriptions::refresh() {
  SafeDir root, folder;
  UniqueFd fd;
  struct stat st {};
  if (!SafeDir::open_root(home_, root).ok() || !root.open_dir(kFolder, false, folder).ok() ||
      !folder.open_file(kFile, O_RDONLY, fd).ok() || ::fstat(fd.get(), &st) != 0) {
    names_.clear();
    lines_ = 0;
    stamp_.reset();
    read_ = true;
    return;
  }
  Stamp now{st.st_dev, st.st_ino, st.st_size, st.st_mtim.tv_sec, st.st_mtim.tv_nsec};
  if (read_ && stamp_ == now) return;
  std::string text;
  char buf[16384];
  for (;;) {
    ssize_t n = ::read(fd.get(), buf, sizeof buf);
    if (n <= 0) break;
    text.append(buf, static_cast<std::size_t>(n));
    if (text.size() >= kFileBytes) break;
  }
  names_ = imap_subscriptions_parse(text, &lines_);
  stamp_ = now;
  read_ = true;
}

// One line at the end of the file, behind a line end should an interrupted
// write have left the last line without one.
int Subscriptions::append(std::string_view line) {
  SafeDir root, folder;
  UniqueFd fd;
  SafeResult r = SafeDir::open_root(home_, root);
  if (r.ok()) r = root.open_dir(kFolder, true, folder);
  if (r.ok()) r = folder.open_file(kFile, O_RDWR | O_APPEND | O_CREAT, fd, 0600);
  if (!r.ok()) return r.error ? r.error : EACCES;
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return errno;
  std::string text;
  char last = '\n';
  if (st.st_size > 0 && ::pread(fd.get(), &last, 1, st.st_size - 1) == 1 && last != '\n') text += '\n';
  text.append(line);
  text += '\n';
  if (int rc = write_all(fd.get(), text)) return rc;
  ++lines_;
  if (::fstat(fd.get(), &st) == 0) stamp_ = Stamp{st.st_dev, st.st_ino, st.st_size, st.st_mtim.tv_sec, st.st_mtim.tv_nsec};
  return 0;
}

int Subscriptions::rewrite(const std::vector<std::string>& names) {
  SafeDir root, folder;
  SafeResult r = SafeDir::open_root(home_, root);
  if (r.ok()) r = root.open_dir(kFolder, true, folder);
  if (!r.ok()) return r.error ? r.error : EACCES;
  if (int rc = folder.replace_file(kFile, imap_subscriptions_text(names))) return rc;
  names_ = names;
  lines_ = names.size();
  read_ = false;  // the next use takes the new file's stamp
  return 0;
}

const std::vector<std::string>& Subscriptions::names() {
  refresh();
  return names_;
}

int Subscriptions::add(const std::string& name) {
  refresh();
  if (std::find(names_.begin(), names_.end(), name) != names_.end()) return 0;
  if (text_size(names_) + name.size() + 1 > kNamesBytes) return E2BIG;
  if (lines_ > 2 * names_.size() + kSlack) {
    std::vector<std::string> names = names_;
    names.push_back(name);
    return rewrite(names);
  }
  if (int rc = append(name)) return rc;
  names_.push_back(name);
  return 0;
}

int Subscriptions::remove(const std::string& name) {
  refresh();
  auto it = std::find(names_.begin(), names_.end(), name);
  if (it == names_.end()) return ENOENT;
  if (lines_ > 2 * names_.size() + kSlack) {
    std::vector<std::string> names = names_;
    names.erase(names.begin() + (it - names_.begin()));
    return rewrite(names);
  }
  if (int rc = append("~" + name)) return rc;
  names_.erase(it);
  return 0;
}

int Subscriptions::carry(std::string_view from, std::optional<std::string_view> to) {
  refresh();
  std::vector<std::string> kept;
  bool changed = false;
  for (const std::string& n : names_) {
    bool under = n.size() > from.size() && n.starts_with(from) && n[from.size()] == '/';
    if (n != from && !under) {
      kept.push_back(n);
      continue;
    }
    changed = true;
    std::string moved = to ? std::string(*to) + n.substr(from.size()) : std::string();
    if (to && std::find(kept.begin(), kept.end(), moved) == kept.end()) kept.push_back(std::move(moved));
  }
  return changed ? rewrite(kept) : 0;
}

}  // namespace velmor
