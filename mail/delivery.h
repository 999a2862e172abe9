// The pieces of local delivery that read a queue file and decide about
// automatic replies (mailbox_append itself is in mail/mailbox.h).
#pragma once

#include <chrono>
#include <cstdint>
#include <ctime>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "mail/mailbox.h"
#include "mail/mailfile.h"

namespace velmor {

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

// ---- delivery in pieces -----------------------------------------------------

// A queued message read once for all its local recipients: its layout, its
// size, and what each group's banned phrases found in it.
struct QueuedMessage {
  explicit QueuedMessage(std::string path);
  bool readable() const { return in.is_open() && !in.failed(); }
  // Whether any phrase of `filter` occurs in the file (searched once per filter).
  bool filter_hit(const std::string& filter);

  std::string path;
  FileSource in;
  QueueLayout layout;
  std::int64_t size = -1;
  std::unordered_map<std::string, bool> filter_hits;
};

// Whether mail for `recipient` can go to a local mailbox: a local address
// of a known user with a home. (Anything else is for the caller to report.)
bool mailbox_recipient_known(std::string_view recipient);

enum class LocalOutcome {
  working,    // more to do: call step() again
  handled,    // dealt with for good: forwarded, refused with an error mail, moved to oddments
  temporary,  // nothing delivered: the queue file is kept for a later try
  staged,     // written to the mailbox; it counts once mailbox_commit_staged() says so
};

// One message for one local recipient, delivered in pieces: the receive
// checks, forward and vacation first, then the message written behind the
// mailbox's last one and parsed, a bounded slice per piece, so that however
// large the message, the thread is never held for long. A piece that finds
// the mailbox replaced or cut back under it starts the writing again.
class LocalDelivery {
 public:
  // `committed` learns, once the message was staged, whether the commit
  // made it durable (0) or took it back out (an errno value).
  LocalDelivery(std::shared_ptr<QueuedMessage> message, std::string recipient, std::string sender,
                std::function<void(int)> committed);
  LocalDelivery(LocalDelivery&&) noexcept;
  LocalDelivery& operator=(LocalDelivery&&) noexcept;
  ~LocalDelivery();
  // Works until `deadline`, one piece at least.
  LocalOutcome step(std::chrono::steady_clock::time_point deadline);

 private:
  struct State;
  std::unique_ptr<State> s_;
};

}  // namespace velmor
