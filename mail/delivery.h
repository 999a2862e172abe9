// The pieces of local delivery that read a queue file and decide about
// automatic replies (mailbox_append itself is in mail/mailbox.h).
#pragma once

#include <cstdint>
#include <ctime>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

class ByteSource;

// Header lines longer than this are copied, not held in memory.
inline constexpr std::size_t kHeaderLineKeep = 8192;

// Where the parts of a queue file lie.
struct QueueLayout {
  std::string envelope;             // the first line, without its line end
  std::uint64_t data_line = 0;      // offset of the DATA line
  std::uint64_t message = 0;        // offset of the message (behind DATA)
  std::uint64_t header_end = 0;     // offset of the header's empty line (or the terminator)
  std::vector<std::string> header;  // header lines, folded continuations joined
};
QueueLayout queue_layout(ByteSource& in);
// The value of the first header line of that name, trimmed; "" when none.
std::string_view header_field(const QueueLayout& q, std::string_view name);

// Whether a message may get a vacation reply: a real sender, no mailing
// list (List-Id, Precedence bulk/list/junk), no automatic reply itself.
bool vacation_reply_wanted(const QueueLayout& q, std::string_view sender);
// Records a reply to `sender` in the record file unless one went to that
// sender within the last week; true when a reply is to go now.
bool vacation_note_sent(const std::string& record_path, std::string_view sender, std::time_t when);

}  // namespace velmor
