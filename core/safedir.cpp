#include "core/safedir.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <vector>

#include "core/util.h"

namespace velmor {

namespace {

SafeResult fail(SafeStatus status, int error, std::string where) {
  return SafeResult{status, error, std::move(where)};
}

// The steps of a relative path; false for "." and ".." (which would leave
// the folder or hide where a step really leads).
bool split_steps(std::string_view rel, std::vector<std::string>& steps) {
  while (!rel.empty()) {
    std::size_t slash = rel.find('/');
    std::string_view step = rel.substr(0, slash);
    rel = slash == std::string_view::npos ? std::string_view() : rel.substr(slash + 1);
    if (step.empty()) continue;
    if (step == "." || step == "..") return false;
    steps.emplace_back(step);
  }
  return true;
}

std::string joined(const std::vector<std::string>& steps, std::size_t upto) {
  std::string out;
  for (std::size_t i = 0; i <= upto && i < steps.size(); ++i) {
    if (i) out += '/';
    out += steps[i];
  }
  return out;
}

// Why opening `name` in `dir` failed with `error`: missing, a link, the
// wrong kind of file, or the system's error.
SafeResult why(int dir, const std::string& name, int error, std::string where) {
  if (error == ENOENT) return fail(SafeStatus::missing, error, std::move(where));
  struct stat st {};
  if (::fstatat(dir, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
    if (S_ISLNK(st.st_mode)) return fail(SafeStatus::link, ELOOP, std::move(where));
    if (error == ELOOP || error == ENOTDIR || error == EISDIR || error == ENXIO) {
      return fail(SafeStatus::wrong_type, error, std::move(where));
    }
  }
  return fail(SafeStatus::failed, error, std::move(where));
}

// Checks what a step opened: its kind, its owner, and that a file has one
// name only.
SafeResult vet(int fd, uid_t owner, bool folder, std::string where) {
  struct stat st {};
  if (::fstat(fd, &st) != 0) return fail(SafeStatus::failed, errno, std::move(where));
  if (folder ? !S_ISDIR(st.st_mode) : !S_ISREG(st.st_mode)) {
    return fail(SafeStatus::wrong_type, folder ? ENOTDIR : EISDIR, std::move(where));
  }
  if (st.st_uid != owner && st.st_uid != ::geteuid()) return fail(SafeStatus::foreign, EPERM, std::move(where));
  if (!folder && st.st_nlink > 1) return fail(SafeStatus::hard_linked, EMLINK, std::move(where));
  return {};
}

constexpr int kStepFlags = O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK;

}  // namespace

bool SafeResult::refused() const {
  return status == SafeStatus::link || status == SafeStatus::wrong_type || status == SafeStatus::foreign ||
         status == SafeStatus::hard_linked;
}

std::string safe_describe(std::string_view root, const SafeResult& result) {
  std::string out(root);
  if (!result.where.empty()) {
    if (out.empty() || out.back() != '/') out += '/';
    out += result.where;
  }
  switch (result.status) {
    case SafeStatus::ok: return out + " is in order";
    case SafeStatus::missing: return out + " does not exist";
    case SafeStatus::link: return out + " is a symbolic link";
    case SafeStatus::wrong_type: return out + " is not of the right kind";
    case SafeStatus::foreign: return out + " belongs to another user";
    case SafeStatus::hard_linked: return out + " has more than one name";
    case SafeStatus::failed: break;
  }
  return out + ": " + error_text(result.error ? result.error : EIO);
}

SafeResult SafeDir::open_root(const std::string& path, SafeDir& out) {
  UniqueFd fd(::open(path.empty() ? "." : path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) {
    int e = errno;
    return fail(e == ENOENT ? SafeStatus::missing : e == ENOTDIR ? SafeStatus::wrong_type : SafeStatus::failed, e, {});
  }
  struct stat st {};
  if (::fstat(fd.get(), &st) != 0) return fail(SafeStatus::failed, errno, {});
  out.fd_ = std::move(fd);
  out.owner_ = st.st_uid;
  return {};
}

SafeResult SafeDir::open_dir(std::string_view rel, bool create, SafeDir& out) const {
  std::vector<std::string> steps;
  if (!split_steps(rel, steps)) return fail(SafeStatus::failed, EINVAL, std::string(rel));
  UniqueFd cur(::fcntl(fd_.get(), F_DUPFD_CLOEXEC, 0));
  if (!cur) return fail(SafeStatus::failed, errno, {});
  for (std::size_t i = 0; i < steps.size(); ++i) {
    const char* name = steps[i].c_str();
    UniqueFd next(::openat(cur.get(), name, O_RDONLY | O_DIRECTORY | kStepFlags));
    if (!next && errno == ENOENT && create) {
      if (::mkdirat(cur.get(), name, 0700) != 0 && errno != EEXIST) {
        return why(cur.get(), steps[i], errno, joined(steps, i));
      }
      next = UniqueFd(::openat(cur.get(), name, O_RDONLY | O_DIRECTORY | kStepFlags));
    }
    if (!next) return why(cur.get(), steps[i], errno, joined(steps, i));
    if (SafeResult r = vet(next.get(), owner_, true, joined(steps, i)); !r.ok()) return r;
    cur = std::move(next);
  }
  out.fd_ = std::move(cur);
  out.owner_ = owner_;
  return {};
}

SafeResult SafeDir::open_file(std::string_view rel, int flags, UniqueFd& out, mode_t mode) const {
  std::size_t slash = rel.rfind('/');
  std::string leaf(slash == std::string_view::npos ? rel : rel.substr(slash + 1));
  std::string_view dir = slash == std::string_view::npos ? std::string_view() : rel.substr(0, slash);
  if (leaf.empty() || leaf == "." || leaf == "..") return fail(SafeStatus::failed, EINVAL, std::string(rel));
  SafeDir folder;
  if (SafeResult r = open_dir(dir, false, folder); !r.ok()) return r;
  UniqueFd fd(::openat(folder.fd(), leaf.c_str(), (flags & ~O_TRUNC) | kStepFlags, mode));
  if (!fd) return why(folder.fd(), leaf, errno, std::string(rel));
  if (SafeResult r = vet(fd.get(), owner_, false, std::string(rel)); !r.ok()) return r;
  out = std::move(fd);
  return {};
}

bool SafeDir::has(std::string_view name) const {
  struct stat st {};
  return ::fstatat(fd_.get(), std::string(name).c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0;
}

SafeResult SafeDir::create_new(std::string_view name, mode_t mode, UniqueFd& out) const {
  std::string n(name);
  if (n.empty() || n.find('/') != std::string::npos) return fail(SafeStatus::failed, EINVAL, n);
  for (int attempt = 0;; ++attempt) {
    UniqueFd fd(::openat(fd_.get(), n.c_str(), O_WRONLY | O_CREAT | O_EXCL | kStepFlags, mode));
    if (fd) {
      out = std::move(fd);
      return {};
    }
    if (errno != EEXIST || attempt > 0) return why(fd_.get(), n, errno, n);
    ::unlinkat(fd_.get(), n.c_str(), 0);  // removes the name only, never what a link points at
  }
}

int SafeDir::replace_file(std::string_view name, std::string_view data, mode_t mode) const {
  std::string tmp = std::string(name) + "~";
  UniqueFd out;
  if (SafeResult r = create_new(tmp, mode, out); !r.ok()) return r.error;
  int rc = write_all(out.get(), data);
  if (!rc && sysio::fsync(out.get()) != 0) rc = errno;
  if (int c = out.close(); !rc) rc = c;
  if (!rc) rc = rename(tmp, name);
  if (rc) {
    remove(tmp);
    return rc;
  }
  return sync();
}

int SafeDir::rename(std::string_view from, std::string_view to) const {
  return sysio::renameat(fd_.get(), std::string(from).c_str(), fd_.get(), std::string(to).c_str()) == 0 ? 0 : errno;
}

int SafeDir::sync() const { return sysio::fsync(fd_.get()) == 0 ? 0 : errno; }

void SafeDir::remove(std::string_view name) const { ::unlinkat(fd_.get(), std::string(name).c_str(), 0); }

}  // namespace velmor
