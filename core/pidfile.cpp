// The pid file and its lock. See core/pidfile.h.
#include "core/pidfile.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace velmor {

namespace {

bool same_file(const struct stat& a, const struct stat& b) { return a.st_dev == b.st_dev && a.st_ino == b.st_ino; }

// What a pid file held, fit for a log line: printable characters only.
std::string shown_content(int fd) {
  char buf[32];
  ssize_t n = ::pread(fd, buf, sizeof buf, 0);
  std::string out;
  for (ssize_t i = 0; i < n; ++i)
    if (buf[i] > ' ' && buf[i] < 0x7f) out += buf[i];
  return out;
}

}  // namespace

PidFile::Claim PidFile::test_lock() {
  // A few rounds at most: each ends early unless the file was replaced
  // between our open and our lock.
  for (int round = 0; round < 5; ++round) {
    UniqueFd fd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NOCTTY | O_NONBLOCK));
    if (!fd) {
      if (errno == ENOENT) return Claim::free;
      error_ = errno == ELOOP ? "it is a symbolic link" : std::strerror(errno);
      return Claim::failed;
    }
    struct stat opened {};
    if (::fstat(fd.get(), &opened) != 0 || !S_ISREG(opened.st_mode)) return Claim::free;
    if (::flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
      if (errno == EWOULDBLOCK) return Claim::running;
      error_ = std::string("it cannot be locked: ") + std::strerror(errno);
      return Claim::failed;
    }
    // The lock counts only if the path still names the file we locked: the
    // suite that held it may have removed or replaced it meanwhile.
    struct stat now {};
    if (::lstat(path_.c_str(), &now) != 0 || !same_file(now, opened)) continue;
    stale_ = shown_content(fd.get());
    held_ = std::move(fd);
    return Claim::stale;
  }
  return Claim::running;  // replaced again and again: someone is at work on it
}

PidFile::Claim PidFile::claim(const std::string& path) {
  remove();
  path_ = path;
  stale_.clear();
  error_.clear();
  replaced_stale_ = false;
  return test_lock();
}

PidFile::Claim PidFile::publish(pid_t pid) {
  if (path_.empty()) return Claim::failed;
  const std::string fresh = path_ + "." + std::to_string(pid) + ".new";
  UniqueFd fd;
  for (int round = 0; round < 2 && !fd; ++round) {
    fd = UniqueFd(::open(fresh.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0644));
    // A leftover of an earlier process that had our number.
    if (!fd && errno == EEXIST && round == 0) ::unlink(fresh.c_str());
  }
  if (!fd) {
    error_ = fresh + ": " + std::strerror(errno);
    return Claim::failed;
  }
  auto give_up = [&](Claim claim, std::string why) {
    ::unlink(fresh.c_str());
    if (!why.empty()) error_ = std::move(why);
    return claim;
  };
  if (::flock(fd.get(), LOCK_EX | LOCK_NB) != 0) return give_up(Claim::failed, std::strerror(errno));
  if (int error = write_all(fd.get(), std::to_string(pid))) return give_up(Claim::failed, std::strerror(error));
  if (!held_) {
    // Nothing was there at claim(): another instance may have come first.
    Claim now = test_lock();
    if (now == Claim::running || now == Claim::failed) return give_up(now, {});
  }
  if (sysio::rename(fresh.c_str(), path_.c_str()) != 0)
    return give_up(Claim::failed, path_ + ": " + std::strerror(errno));
  replaced_stale_ = static_cast<bool>(held_);
  held_ = std::move(fd);  // the replaced file's lock goes with its descriptor
  published_ = true;
  return replaced_stale_ ? Claim::stale : Claim::free;
}

void PidFile::remove() {
  if (published_ && held_) {
    struct stat ours {}, there {};
    if (::fstat(held_.get(), &ours) == 0 && ::lstat(path_.c_str(), &there) == 0 && same_file(ours, there))
      ::unlink(path_.c_str());
  }
  held_.close();
  published_ = false;
}

}  // namespace velmor
