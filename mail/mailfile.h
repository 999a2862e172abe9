// Reading mailbox files: a line reader over any byte source (a file read in
// large windows, or text in memory). Descriptors and checked writes are in
// core/fileio.h.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "core/fileio.h"

namespace velmor {

class ByteSource {
 public:
  virtual ~ByteSource() = default;
  virtual std::uint64_t size() const = 0;
  // The bytes from `offset` on: at least `want` of them unless the source
  // ends first. Valid until the next call. Empty at the end or on a failure.
  virtual std::string_view view(std::uint64_t offset, std::size_t want) = 0;
  virtual bool failed() const { return false; }
};

class TextSource : public ByteSource {
 public:
  explicit TextSource(std::string_view text) : text_(text) {}
  std::uint64_t size() const override { return text_.size(); }
  std::string_view view(std::uint64_t offset, std::size_t want) override;

 private:
  std::string_view text_;
};

// A file read through one window; the window holds at least 64 KiB.
class FileSource : public ByteSource {
 public:
  // Takes its own descriptor on `path` (read only).
  explicit FileSource(const std::string& path);
  // Reads through a descriptor owned by the caller.
  explicit FileSource(int fd);
  // Reads through a descriptor it takes over (one opened safely below a home).
  explicit FileSource(UniqueFd fd);
  bool is_open() const { return fd_ >= 0; }
  std::uint64_t size() const override { return size_; }
  std::string_view view(std::uint64_t offset, std::size_t want) override;
  bool failed() const override { return failed_; }
  // Re-reads the size (the file may have grown) and drops the window.
  void refresh();

 private:
  UniqueFd own_;
  int fd_ = -1;
  std::uint64_t size_ = 0;
  std::string window_;
  std::uint64_t window_offset_ = 0;
  bool failed_ = false;
};

// The first `limit` bytes of another source (what is behind them is not
// there for the reader).
class LimitedSource final : public ByteSource {
 public:
  LimitedSource(ByteSource& in, std::uint64_t limit) : in_(in), limit_(limit) {}
  std::uint64_t size() const override { return in_.size() < limit_ ? in_.size() : limit_; }
  std::string_view view(std::uint64_t offset, std::size_t want) override {
    if (offset >= size()) return {};
    std::string_view v = in_.view(offset, want);
    std::uint64_t left = size() - offset;
    return v.size() > left ? v.substr(0, static_cast<std::size_t>(left)) : v;
  }
  bool failed() const override { return in_.failed(); }

 private:
  ByteSource& in_;
  std::uint64_t limit_;
};

struct Line {
  std::uint64_t offset = 0;
  std::uint64_t length = 0;  // including the line end; 0 at the end of the source
  std::string_view text;     // at most `keep` bytes of the line, line end included when kept
};
// The line at `offset`, running to its LF or to the end of the source. The
// text is valid until the next call on the source.
Line read_line(ByteSource& in, std::uint64_t offset, std::size_t keep = 8192);

// The line's text without its CR LF (or LF).
std::string_view line_body(std::string_view text);
// A line that holds only "." (the end of a message in transmission form).
bool is_terminator_line(std::string_view text);

}  // namespace velmor
