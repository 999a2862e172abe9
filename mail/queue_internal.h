// Pieces shared by the queue, debatch and the SMTP server; not for other
// subsystems.
#pragma once

#include <chrono>
#include <cstdint>
#include <ctime>
#include <functional>
#include <list>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/filecache.h"
#include "mail/mailfile.h"
#include "mail/queue.h"

namespace velmor {

// filecache_copy's count for "up to the end of the file".
inline constexpr std::uint64_t kToEnd = ~std::uint64_t{0};

// A queue file read through the file cache, as a source for the line reader
// of mail/mailfile.h. A view is at least as long as asked for unless the
// file ends first, even across the cache's windows.
class CacheSource final : public ByteSource {
 public:
  explicit CacheSource(CacheFile& file) : file_(file) {}
  std::uint64_t size() const override { return filecache_length(file_); }
  std::string_view view(std::uint64_t offset, std::size_t want) override;

 private:
  CacheFile& file_;
  std::string joined_;
};

// How reading a line went.
enum class LineRead {
  ok,
  cut,  // longer than the limit: `line` holds its start, `offset` is past all of it
  end,  // no more lines
};
// Reads one line (without its CR LF) starting at `offset` and moves `offset`
// past its line end. A line is never cut silently: a longer one says so.
LineRead queue_read_line(ByteSource& in, std::uint64_t& offset, std::string& line, std::size_t max);

// Envelope lines are far shorter: "RCPT TO:<" and a path of kMaxAddress.
inline constexpr std::size_t kMaxEnvelopeLine = 1024;

// The envelope of a queue file.
struct QueueEnvelope {
  std::string first_line;
  std::string sender;   // empty for the null sender
  bool has_sender_bracket = false;
  bool fetched = false;  // a message fetched by the POP3 client ("POP...")
  std::vector<std::string> recipients;
  bool has_data = false;          // the envelope ends with a DATA line
  std::uint64_t data_offset = 0;  // where the DATA line starts
  std::uint64_t body_offset = 0;  // the byte after the DATA line
  // Set when a line or an address of the envelope is too long to be read
  // whole: such a file is never delivered on a guess.
  bool damaged = false;
};
QueueEnvelope queue_read_envelope(ByteSource& in);
QueueEnvelope queue_read_envelope(CacheFile& file);

// True when any needle occurs in the file (case-insensitive), searched block
// by block as the cache loads it.
bool file_contains(CacheFile& file, const std::vector<std::string>& needles);

// How an error mail went.
enum class ErrorMail {
  sent,      // written safely into the incoming queue
  skipped,   // nobody to send it to (the null sender, no address)
  moved,     // the file was moved to oddments instead (loop, no queue file)
  failed,    // the error mail could not be written
};
// With `headers_only`, only the header of the failed message is attached
// (for refusals by size or content, which the whole message would repeat).
ErrorMail send_error_mail(std::string_view text, std::string_view to, const std::string& file,
                          bool headers_only = false);

// Incoming files committed in groups (the SMTP server, the POP3 client):
// the message is written to its hidden name and flushed without a sync of
// its own; one commit then syncs the file system once, renames every
// finished file into place and syncs the folder once, so a burst of
// messages costs two syncs in all rather than two each. Nothing is
// acknowledged (or deleted at its source) before its commit. The commit
// runs after the loop's pass (queue_commit_register).
struct PendingIncoming {
  CacheFile file;         // writes go to the hidden name
  std::string path;       // the final name
  std::string hidden;     // the name it is written under
};
PendingIncoming queue_open_incoming_pending();
// The incoming folder (mail.dir.incoming).
std::string queue_incoming_dir();
// Queues a flushed file for the next commit; `done(error)` is called when it
// has run (error 0: the file is in place, durable and in the incoming list;
// otherwise the hidden file is gone). Whoever waits for `done` and may go
// away first must make it harmless (it is called in any case).
void queue_commit_later(std::string path, std::string hidden, std::function<void(int error)> done);
bool queue_commit_pending();
// Runs the commit for every file queued so far.
void queue_commit();
// Has the loop run the commit after every pass.
void queue_commit_register();

// Keeps a queue file for the recipients still to do: `first_line`, these
// recipients and the message from its DATA line are written under the
// hidden name, synced and renamed over the file, and the folder is synced.
// A crash on the way leaves the old file, so a recipient already served may
// get the message twice, but none loses it. 0 or an errno value (the old
// file is then unchanged, unless only the folder sync failed).
int queue_rewrite_envelope(CacheFile& file, const QueueEnvelope& env, std::string_view first_line,
                           const std::vector<std::string>& recipients);

// Throws away an unfinished queue file (and the name reserved for it).
void queue_file_discard(CacheFile& file);

// Text made safe as message lines: CR LF line ends, dot-stuffed.
std::string mail_body_lines(std::string_view text);

// The outgoing list for the SMTP client, which claims entries (`holder`)
// and drops the entry of a file it has delivered or returned.
std::list<OutgoingEntry>& queue_outgoing_entries();
void queue_drop_outgoing(const std::string& path);

// Start-up of the queue itself: name counters from `now`, unfinished
// hidden files removed.
void queue_init(std::time_t now);
// Takes the head of the incoming list.
std::optional<std::string> queue_pop_incoming();
// The "listmq" listing, one datagram per call of `send`.
void queue_list(const std::function<void(std::string_view)>& send);

// One line of the mail log (stamped like every other line there) for each
// delivery, forward, message queued to be sent, error mail and oddment.
void mail_log(std::string_view line);

// Noted whenever an SMTP connection receives data (the quiet period before
// debatching runs from the last traffic).
void mail_note_traffic();

// Debatches one incoming file at once (the whole processing of one message).
void debatch_file(const std::string& path);
// Debatches from the incoming list until `deadline`, one recipient at
// least: the file in hand is continued, or the next one taken. `working`
// when the deadline came before the file's end.
enum class DebatchStep { idle, working, finished };
DebatchStep debatch_step(std::chrono::steady_clock::time_point deadline);
// A file left queued after a temporary failure is tried again after this
// many seconds.
inline constexpr int kRetrySeconds = 60;
void queue_retry_later();

}  // namespace velmor
