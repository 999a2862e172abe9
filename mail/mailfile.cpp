#include "mail/mailfile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <utility>

namespace velmor {

namespace {
constexpr std::size_t kWindow = 64 * 1024;
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

FileSource::FileSource(UniqueFd fd) : own_(std::move(fd)), fd_(own_.get()) { refresh(); }

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

}  // namespace velmor
