// Plain file and path helpers, and the one door through which the suite's
// durable writes reach the disk: every write, sync, rename and truncate that
// decides whether data is safe goes through `sysio`, so a test can count the
// syncs and make the n-th write, sync or rename fail. Production pays one
// counter increment per call.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <string_view>

namespace velmor {

// A descriptor that closes itself.
class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept;
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd();

  int get() const { return fd_; }
  explicit operator bool() const { return fd_ >= 0; }
  int release() {
    int fd = fd_;
    fd_ = -1;
    return fd;
  }
  // Closes now; 0 or the errno of a failed close.
  int close();

 private:
  int fd_ = -1;
};

namespace sysio {

// The calls the seam watches. Each behaves as the system call of that name
// (-1 with errno set on failure).
enum class Op { write, sync, rename, truncate };
inline constexpr int kOps = 4;

ssize_t write(int fd, const void* data, std::size_t n);
ssize_t pwrite(int fd, const void* data, std::size_t n, off_t offset);
int fsync(int fd);      // counted as Op::sync
int syncfs(int fd);     // counted as Op::sync
int rename(const char* from, const char* to);
int renameat(int from_dir, const char* from, int to_dir, const char* to);
int ftruncate(int fd, off_t length);

// ---- the test seam -----------------------------------------------------
// Calls of `op` made since the last reset.
std::uint64_t count(Op op);
// The n-th call of `op` from now (1 = the next one) fails with `error`
// without touching the disk; 0 cancels.
void fail_nth(Op op, std::uint64_t n, int error = 5 /* EIO */);
// Zeroes the counts and cancels every planned failure.
void reset();

}  // namespace sysio

// Writes all of `data` at the descriptor's position. 0 or an errno value.
int write_all(int fd, std::string_view data);
// The same outside the seam, for log lines: a test that fails the n-th
// durable write is not thrown off by a log line written in between.
int write_all_unwatched(int fd, std::string_view data);
// Writes all of `data` at `offset`. 0 or an errno value.
int pwrite_all(int fd, std::string_view data, std::uint64_t offset);
// Copies `length` bytes from `offset` of `from` to the position of `to`.
// 0 or an errno value (EIO when the source is shorter).
int copy_range(int from, std::uint64_t offset, std::uint64_t length, int to);
// fsync of a folder, so a rename or a new name in it is durable.
int sync_dir(const std::string& dir);
// fsync of the folder that holds `path`.
int sync_parent_dir(const std::string& path);

// ---- paths and stat --------------------------------------------------------

std::int64_t file_size(const std::string& path);   // -1 when missing
std::int64_t file_mtime(const std::string& path);  // seconds; 0 when unreadable
bool file_is_regular(const std::string& path);
bool file_is_directory(const std::string& path);
std::string_view path_extension(std::string_view path);  // after the last "." of the leaf
std::string_view path_leaf(std::string_view path);       // after the last "/"
std::string_view path_dir(std::string_view path);        // before the last "/" ("" when none)
std::string path_join(std::string_view dir, std::string_view name);  // exactly one "/"
void make_parent_dirs(const std::string& file_path);  // every parent, mode 0744
void make_path(const std::string& dir_path);          // every directory along, mode 0770

}  // namespace velmor
