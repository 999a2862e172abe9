#include "core/fileio.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>

namespace velmor {

UniqueFd& UniqueFd::operator=(UniqueFd&& other) noexcept {
  if (this != &other) {
    close();
    fd_ = other.release();
  }
  return *this;
}

UniqueFd::~UniqueFd() { close(); }

int UniqueFd::close() {
  if (fd_ < 0) return 0;
  int rc = ::close(fd_) == 0 ? 0 : errno;
  fd_ = -1;
  return rc;
}

namespace sysio {

namespace {
struct Seam {
  std::array<std::uint64_t, kOps> calls{};
  std::array<std::uint64_t, kOps> fail_at{};  // absolute call number; 0 = none
  std::array<int, kOps> error{};
};
Seam g_seam;

// Counts a call of `op`; true (errno set) when this one is to fail.
bool planned_failure(Op op) {
  auto i = static_cast<std::size_t>(op);
  ++g_seam.calls[i];
  if (g_seam.fail_at[i] == 0 || g_seam.calls[i] != g_seam.fail_at[i]) return false;
  g_seam.fail_at[i] = 0;
  errno = g_seam.error[i];
  return true;
}
}  // namespace

ssize_t write(int fd, const void* data, std::size_t n) {
  return planned_failure(Op::write) ? -1 : ::write(fd, data, n);
}

ssize_t pwrite(int fd, const void* data, std::size_t n, off_t offset) {
  return planned_failure(Op::write) ? -1 : ::pwrite(fd, data, n, offset);
}

int fsync(int fd) { return planned_failure(Op::sync) ? -1 : ::fsync(fd); }
int syncfs(int fd) { return planned_failure(Op::sync) ? -1 : ::syncfs(fd); }

int rename(const char* from, const char* to) {
  return planned_failure(Op::rename) ? -1 : ::rename(from, to);
}

int renameat(int from_dir, const char* from, int to_dir, const char* to) {
  return planned_failure(Op::rename) ? -1 : ::renameat(from_dir, from, to_dir, to);
}

int ftruncate(int fd, off_t length) {
  return planned_failure(Op::truncate) ? -1 : ::ftruncate(fd, length);
}

std::uint64_t count(Op op) { return g_seam.calls[static_cast<std::size_t>(op)]; }

void fail_nth(Op op, std::uint64_t n, int error) {
  auto i = static_cast<std::size_t>(op);
  g_seam.fail_at[i] = n ? g_seam.calls[i] + n : 0;
  g_seam.error[i] = error;
}

void reset() { g_seam = Seam{}; }

}  // namespace sysio

namespace {
template <class WriteCall>
int write_loop(int fd, std::string_view data, WriteCall call) {
  while (!data.empty()) {
    ssize_t n = call(fd, data.data(), data.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (n == 0) return EIO;
    data.remove_prefix(static_cast<std::size_t>(n));
  }
  return 0;
}
}  // namespace

int write_all(int fd, std::string_view data) { return write_loop(fd, data, sysio::write); }
int write_all_unwatched(int fd, std::string_view data) { return write_loop(fd, data, ::write); }

int pwrite_all(int fd, std::string_view data, std::uint64_t offset) {
  while (!data.empty()) {
    ssize_t n = sysio::pwrite(fd, data.data(), data.size(), static_cast<off_t>(offset));
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (n == 0) return ENOSPC;
    data.remove_prefix(static_cast<std::size_t>(n));
    offset += static_cast<std::uint64_t>(n);
  }
  return 0;
}

int copy_range(int from, std::uint64_t offset, std::uint64_t length, int to) {
  std::string buf(static_cast<std::size_t>(std::min<std::uint64_t>(length, 256 * 1024)), '\0');
  while (length > 0) {
    std::size_t chunk = static_cast<std::size_t>(std::min<std::uint64_t>(length, buf.size()));
    ssize_t n = ::pread(from, buf.data(), chunk, static_cast<off_t>(offset));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return errno;
    if (n == 0) return EIO;  // the source is shorter than its records say
    if (int rc = write_all(to, std::string_view(buf.data(), static_cast<std::size_t>(n)))) return rc;
    offset += static_cast<std::uint64_t>(n);
    length -= static_cast<std::uint64_t>(n);
  }
  return 0;
}

int sync_dir(const std::string& dir) {
  UniqueFd fd(::open(dir.empty() ? "." : dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) return errno;
  return sysio::fsync(fd.get()) == 0 ? 0 : errno;
}

int sync_parent_dir(const std::string& path) { return sync_dir(std::string(path_dir(path))); }

// ---- paths and stat --------------------------------------------------------

std::int64_t file_size(const std::string& path) {
  struct stat st{};
  return ::stat(path.c_str(), &st) == 0 ? static_cast<std::int64_t>(st.st_size) : -1;
}

std::int64_t file_mtime(const std::string& path) {
  struct stat st{};
  return ::stat(path.c_str(), &st) == 0 ? static_cast<std::int64_t>(st.st_mtime) : 0;
}

bool file_is_regular(const std::string& path) {
  struct stat st{};
  return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

bool file_is_directory(const std::string& path) {
  struct stat st{};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::string_view path_leaf(std::string_view path) {
  std::size_t slash = path.rfind('/');
  return slash == std::string_view::npos ? path : path.substr(slash + 1);
}

std::string_view path_extension(std::string_view path) {
  std::string_view leaf = path_leaf(path);
  std::size_t dot = leaf.rfind('.');
  return dot == std::string_view::npos ? std::string_view() : leaf.substr(dot + 1);
}

std::string_view path_dir(std::string_view path) {
  std::size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return {};
  return slash == 0 ? path.substr(0, 1) : path.substr(0, slash);
}

std::string path_join(std::string_view dir, std::string_view name) {
  while (!name.empty() && name.front() == '/') name.remove_prefix(1);
  while (dir.size() > 1 && dir.back() == '/') dir.remove_suffix(1);
  if (dir.empty()) return std::string(name);
  std::string out(dir);
  if (out.back() != '/') out += '/';
  out += name;
  return out;
}

namespace {
constexpr std::size_t kMaxPath = 4095;

// Makes every directory whose path ends before position `end` of `path`.
void make_dirs_upto(const std::string& path, std::size_t end, mode_t mode) {
  if (path.size() > kMaxPath) return;
  for (std::size_t i = 1; i <= end && i <= path.size(); ++i) {
    if (i == path.size() || path[i] == '/') {
      if (path[i - 1] == '/') continue;
      std::string dir = path.substr(0, i);
      ::mkdir(dir.c_str(), mode);
    }
  }
}
}  // namespace

void make_parent_dirs(const std::string& file_path) {
  std::size_t slash = file_path.rfind('/');
  if (slash == std::string::npos || slash == 0) return;
  make_dirs_upto(file_path, slash, 0744);
}

void make_path(const std::string& dir_path) { make_dirs_upto(dir_path, dir_path.size(), 0770); }

}  // namespace velmor
