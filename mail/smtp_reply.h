// Replies of an SMTP server, read whole: any number of "NNN-text" lines,
// then the line whose code is followed by a blank (or nothing). However the
// reads split them, a reply is acted on only once its last line is in, so
// a multi-line greeting never shifts the replies that follow.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace velmor {

enum class ReplyRead {
  need_more,  // a continuation line: the reply goes on
  complete,   // the last line is in: code() and text() hold the reply
  malformed,  // not a reply line, a code that changes, or far too long
};

class SmtpReply {
 public:
  // Lines of one reply, and of its text, kept at most.
  static constexpr std::size_t kMaxLines = 100;
  static constexpr std::size_t kMaxText = 2000;

  // One line, without its line end. After complete or malformed, clear()
  // before the next reply.
  ReplyRead add(std::string_view line);
  void clear();
  int code() const { return code_; }
  int kind() const { return code_ / 100; }  // 2 done, 3 go on, 4 try later, 5 refused
  // The reply's lines joined by LF (cut at kMaxText), for logs and error mails.
  const std::string& text() const { return text_; }

 private:
  int code_ = 0;
  std::size_t lines_ = 0;
  std::string text_;
};

}  // namespace velmor
