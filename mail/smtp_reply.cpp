#include "mail/smtp_reply.h"

namespace velmor {

namespace {
bool digit(char c) { return c >= '0' && c <= '9'; }
}  // namespace

ReplyRead SmtpReply::add(std::string_view line) {
  if (line.size() < 3 || line[0] < '2' || line[0] > '5' || !digit(line[1]) || !digit(line[2]))
    return ReplyRead::malformed;
  const int code = (line[0] - '0') * 100 + (line[1] - '0') * 10 + (line[2] - '0');
  if (lines_ > 0 && code != code_) return ReplyRead::malformed;
  if (++lines_ > kMaxLines) return ReplyRead::malformed;
  code_ = code;
  if (text_.size() < kMaxText) {
    if (!text_.empty()) text_ += '\n';
    text_.append(line.substr(0, kMaxText - text_.size()));
  }
  if (line.size() == 3 || line[3] == ' ') return ReplyRead::complete;
  if (line[3] == '-') return ReplyRead::need_more;
  return ReplyRead::malformed;
}

void SmtpReply::clear() {
  code_ = 0;
  lines_ = 0;
  text_.clear();
}

}  // namespace velmor
