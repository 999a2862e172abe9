#include "mail/mailfile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace velmor {

namespace {
constexpr std::size_t kWindow = 64 * 1024;
}

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

std::string_view TextSource::view(std::uint64_t offset, std::size_t) {
  if (offset >= text_.size()) return {};
  return text_.substr(offset);
}

FileSource::FileSource(const std::string& path)
    : own_(::open(path.c_str(), O_RDONLY | O_CLOEXEC)), fd_(own_.get()) {
  refresh();
}

FileSource::FileSource(int fd) : fd_(fd) { refresh(); }

void FileSource::refresh() {
  window_.clear();
  window_offset_ = 0;
  struct stat st {};
  if (fd_ < 0 || ::fstat(fd_, &st) != 0) {
    size_ = 0;
    failed_ = fd_ >= 0;
    return;
  }
  size_ = static_cast<std::uint64_t>(st.st_size);
}

std::string_view FileSource::view(std::uint64_t offset, std::size_t want) {
  if (offset >= size_ || fd_ < 0) return {};
  want = static_cast<std::size_t>(std::min<std::uint64_t>(want, size_ - offset));
  if (offset >= window_offset_ && offset + want <= window_offset_ + window_.size()) {
    return std::string_view(window_).substr(offset - window_offset_);
  }
  std::size_t room = static_cast<std::size_t>(
      std::min<std::uint64_t>(std::max(want, kWindow), size_ - offset));
  window_.resize(room);
  window_offset_ = offset;
  std::size_t got = 0;
  while (got < room) {
    ssize_t n = ::pread(fd_, window_.data() + got, room - got, static_cast<off_t>(offset + got));
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      if (n < 0) failed_ = true;
      break;
    }
    got += static_cast<std::size_t>(n);
  }
  window_.resize(got);
  return window_;
}

Line read_line(ByteSource& in, std::uint64_t offset, std::size_t keep) {
  Line line;
  line.offset = offset;
  std::string_view v = in.view(offset, keep);
  if (v.empty()) return line;
  std::size_t lf = v.find('\n');
  if (lf != std::string_view::npos) {
    line.length = lf + 1;
    line.text = v.substr(0, std::min(line.length, static_cast<std::uint64_t>(keep)));
    return line;
  }
  // A line longer than the window: find its end, then view its start again.
  std::uint64_t pos = offset + v.size();
  while (true) {
    std::string_view more = in.view(pos, keep);
    if (more.empty()) break;
    std::size_t at = more.find('\n');
    if (at != std::string_view::npos) {
      pos += at + 1;
      break;
    }
    pos += more.size();
  }
  line.length = pos - offset;
  line.text = in.view(offset, keep).substr(0, std::min(line.length, static_cast<std::uint64_t>(keep)));
  return line;
}

std::string_view line_body(std::string_view text) {
  if (!text.empty() && text.back() == '\n') text.remove_suffix(1);
  if (!text.empty() && text.back() == '\r') text.remove_suffix(1);
  return text;
}

bool is_terminator_line(std::string_view text) { return line_body(text) == "." && text.size() > 1; }

int write_all(int fd, std::string_view data) {
  while (!data.empty()) {
    ssize_t n = ::write(fd, data.data(), data.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (n == 0) return EIO;
    data.remove_prefix(static_cast<std::size_t>(n));
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

int sync_parent_dir(const std::string& path) {
  std::size_t slash = path.rfind('/');
  std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : path.substr(0, slash));
  UniqueFd fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) return errno;
  return ::fsync(fd.get()) == 0 ? 0 : errno;
}

}  // namespace velmor
