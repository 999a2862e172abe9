// Local mailboxes. A mailbox is a file of messages, each starting with a
// "From sender date" separator line, all lines CR LF, bodies in SMTP
// transmission form ending with a "." line. Beside every mailbox an overview
// index (<dir>/overview/<box>) lists each message's lengths, dates, flags,
// unique identifier and main headers, plus its MIME parts, so readers list a
// mailbox without reading it.
#pragma once

#include <chrono>
#include <cstdint>
#include <ctime>
#include <functional>
#include <list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "core/fileio.h"

namespace velmor {

class CacheFile;

// Message flags.
namespace msgflag {
inline constexpr std::uint32_t answered = 0x08;
inline constexpr std::uint32_t deleted = 0x10;
inline constexpr std::uint32_t seen = 0x20;
inline constexpr std::uint32_t mime = 0x100;
inline constexpr std::uint32_t receipt_wanted = 0x200;
inline constexpr std::uint32_t draft = 0x400;
inline constexpr std::uint32_t flagged = 0x800;
inline constexpr std::uint32_t recent = 0x1000;
}  // namespace msgflag

struct MimePart {
  std::string content_type, description, content_id;
  std::uint32_t length = 0, lines = 0, body_offset = 0;
  int encoding = 0;  // 3 base64, 4 quoted-printable, 0 other
  int level = 1, number = 1;
};

inline constexpr std::uint64_t kUncounted = ~std::uint64_t{0};

struct MessageRecord {
  std::string from, to, subject, reply_to;
  std::time_t internal_date = 0, sent_date = 0;
  std::uint64_t total_length = 0;   // including the separator line
  std::uint64_t length = 0;         // without it
  std::uint32_t flags = 0;
  std::uint32_t uid = 0;
  std::uint64_t header_length = 0;  // offset of the body from the message start
  std::list<MimePart> parts;
  bool flags_pending = false;       // changed since the overview last recorded its flags
  // The text a reader is given is the stored one behind the separator line,
  // without the "." line that ends it and with the dots of transmission
  // form taken out: `dots` lines carry such a dot (header lines too),
  // `end_line` is the length of the closing "." line (0 when there is none)
  // and `body_lines` counts the body's lines without it. Counted while
  // parsing; kUncounted in a record from an overview written before they
  // were kept (a reader counts them when it needs them).
  std::uint64_t dots = kUncounted;
  std::uint64_t body_lines = 0;
  std::uint32_t end_line = 0;
};
// "Message start" is the start of its separator line throughout: a message
// without one (a damaged file's first message) has total_length == length.

// Mailbox record flags.
namespace boxflag {
inline constexpr std::uint32_t in_use = 0x01;  // a POP3/IMAP/web-mail session has it
inline constexpr std::uint32_t new_mail = 0x1000;
inline constexpr std::uint32_t delivered = 0x10000;
}  // namespace boxflag

// A message written behind the committed end of a mailbox and parsed, whose
// delivery counts once the mailbox and its overview are synced
// (mailbox_commit_staged). `done` learns how that went: 0, or an errno
// value when the message was taken back out.
struct StagedMessage {
  MessageRecord record;
  std::function<void(int error)> done;
};

struct Mailbox {
  std::string path;
  // The user's home the mailbox lies below. The home is trusted (it comes
  // from the users file); everything below it belongs to the user and is
  // reached without following links (core/safedir.h).
  std::string home;
  std::uint32_t flags = 0;
  std::uint64_t in_use_by = 0;  // Connection::id() of the in-use mark's holder; 0 = none
  // The POP3 session among the sharers (one at a time: RFC 1939's lock); 0 = none.
  std::uint64_t pop_holder = 0;
  // IMAP sessions and one POP3 session share a mailbox (the in-use mark is
  // then set with in_use_by 0, so web mail stays out); each is told when
  // the mailbox changes under it (new mail, flags, an expunge), so that its
  // own view of the mailbox can catch up.
  struct Sharer {
    std::uint64_t owner = 0;
    std::function<void()> changed;
  };
  std::vector<Sharer> sharers;
  // Chosen when the mailbox is first indexed and kept in its overview, so
  // identifiers stay valid across restarts (0 = not chosen yet).
  std::uint32_t uid_validity = 0;
  // Messages with identifiers above this one are new to the next IMAP
  // session that looks (\Recent); kept in memory only.
  std::uint32_t recent_uid = 0;
  int count = 0, unseen = 0;
  std::uint32_t next_uid = 1;
  bool changed = false;
  std::time_t looked_up = 0, overview_written = 0, loaded = 0;
  std::list<MessageRecord> messages;
  std::uint64_t bytes = 0;  // the committed length: the sum of the messages' lengths

  // The overview file as it is on disk: its length (0 = unknown, written
  // whole next time), and the length it would have written afresh. Appends
  // and removals only add records to it; it is compacted once the dead
  // records outweigh the live ones.
  std::uint64_t overview_size = 0, overview_live = 0;
  std::vector<MessageRecord*> flags_pending;  // flag changes not yet in the overview

  // Appends not yet committed. `tail` is the end of everything written to
  // the file (the committed length when nothing is), `appending` tells that
  // a message is being written there now, and `epoch` changes whenever the
  // file is replaced or cut back, so an append in flight starts again.
  std::list<StagedMessage> staged;
  std::uint64_t tail = 0;
  bool appending = false;
  std::uint64_t epoch = 0;
  UniqueFd append_fd;  // the file the staged messages were written to
};

// Delivers one queued message to a local recipient.
//   1 = dealt with (delivered, forwarded, or refused with an error mail);
//   0 = not handled (the caller treats the user as unknown);
//   2 = a temporary failure (disk full, mailbox unwritable): nothing was
//       delivered, the mailbox is as it was, and the queue file must be kept
//       for a later try.
inline constexpr int kAppendTemporaryFailure = 2;
int mailbox_append(const std::string& queue_file, std::string_view recipient, std::string_view sender);
std::string mailbox_path_for_name(std::string_view home, std::string_view name);
std::string mailbox_overview_path(std::string_view mailbox_path);
// The cached record of the mailbox `path` below the home `home` (loading
// or rebuilding its overview); nullptr when the path is not a regular file
// or is refused (a link, another user's file; logged). A mailbox longer
// than its records is settled first: a tail of whole messages is taken in,
// what an interrupted append left is cut off.
Mailbox* mailbox_lookup(const std::string& path, const std::string& home);
// The same for a mailbox in <home>/mail/: the home is the folder above.
Mailbox* mailbox_lookup(const std::string& path);
// The mailbox file opened for reading the safe way; an empty descriptor
// when it is missing or refused.
UniqueFd mailbox_open(const Mailbox& box);
// The exclusive in-use mark (web mail): true when taken (or already held
// by `owner`), never while sessions share the mailbox. The owner is a connection's never-reused id, so
// a mark can never pass to a later connection on the same descriptor.
bool mailbox_take(Mailbox& box, std::uint64_t owner);
void mailbox_release(Mailbox& box, std::uint64_t owner);
// The shared form for IMAP (and POP3) sessions: any number of them hold a mailbox at
// once, never together with an exclusive holder. `changed` is called (it
// must only take note) whenever the mailbox changes. mailbox_release lets
// go of either form.
bool mailbox_share(Mailbox& box, std::uint64_t owner, std::function<void()> changed);
// A POP3 session's hold: shared with IMAP sessions (it hears no changes:
// it works on the messages present when it took the mailbox), but one POP3
// session at a time. mailbox_release lets go of it.
bool mailbox_share_pop(Mailbox& box, std::uint64_t owner);
// Tells every sharer that the mailbox changed.
void mailbox_notify(Mailbox& box);
// Drops the cached mailbox `path` and every one in a folder of that path
// (they were deleted or renamed). Refused, with nothing dropped, while
// anyone holds one of them or messages are being written into it.
bool mailbox_forget(const std::string& path);
// Removes the deleted messages, rewriting the mailbox through a temporary
// file (made O_EXCL beside it, synced, given the old owner through its
// descriptor) and a rename. 0 or an errno value (the old mailbox is then
// intact). With `only`, just the deleted messages it accepts go.
int mailbox_expunge(Mailbox& box, const std::function<bool(const MessageRecord&)>& only = {});
int mailbox_overview_write(Mailbox& box);
int mailbox_overview_read(Mailbox& box);
// Marks a message seen by `user` (the message starts at `offset` of the
// mailbox file). The first time, a message that asked for a read receipt
// gets one queued to its sender. 0, or non-zero when the receipt could not
// be queued.
int mailbox_mark_seen(Mailbox& box, MessageRecord& message, std::uint64_t offset, std::string_view user);

// ---- the pieces the above are built from (also used by the tests) ----------

class ByteSource;  // mail/mailfile.h
inline constexpr std::uint64_t kNoMessage = ~std::uint64_t{0};
// Parses the message that starts at `offset`, appends its record to the box
// (assigning its identifier) and returns where the next message starts, or
// kNoMessage at the end. A "From " line starts a message only at the start
// of the file or right after the "." line that ends the previous message.
std::uint64_t mailbox_parse_message(ByteSource& in, std::uint64_t offset, Mailbox& box);
// Parses one message in pieces, so that a large one never holds the thread
// for long: each step() reads about `budget` bytes of lines.
class MessageParser {
 public:
  explicit MessageParser(std::uint64_t offset);
  MessageParser(MessageParser&&) noexcept;
  MessageParser& operator=(MessageParser&&) noexcept;
  ~MessageParser();
  // True once the message has ended (or the source failed: in.failed()).
  bool step(ByteSource& in, std::uint64_t budget);
  // The finished record (its `uid` is the X-UID header's value, 0 when
  // none) and where the next message starts (kNoMessage at the end).
  MessageRecord take(std::uint64_t& next);

 private:
  struct State;
  std::unique_ptr<State> s_;
};

// ---- appends, in pieces, committed in groups --------------------------------
// Delivery writes each message behind `tail` (mailbox_append_begin reserves
// the place and an identifier), parses it, and stages it; one commit then
// syncs the mailbox once, appends the staged messages' records to the
// overview and syncs that once, and only then are they delivered.

struct AppendSlot {
  std::uint64_t offset = 0;  // where the message goes
  std::uint32_t uid = 0;     // the identifier it carries
  std::uint64_t epoch = 0;   // the file generation it was reserved in
};
// Reserves the place behind everything written so far; `fd` is the mailbox
// opened for writing, kept by the box until the commit. Fails (EAGAIN) while
// another message is being written into the box.
int mailbox_append_begin(Mailbox& box, UniqueFd fd, AppendSlot& slot);
// The descriptor an append writes through (valid while the slot's epoch holds).
int mailbox_append_fd(const Mailbox& box);
// The message of `slot` is written up to `end`; parsed, it waits for the
// commit with `done`.
void mailbox_append_stage(Mailbox& box, const AppendSlot& slot, MessageRecord record, std::function<void(int)> done);
// The append of `slot` failed: the file is cut back to where it began and
// its identifier is given back when no later one was handed out.
void mailbox_append_abandon(Mailbox& box, const AppendSlot& slot);
// Takes back every staged message not yet committed (none may be in the
// middle of being written): the file is cut back to the committed length,
// their identifiers are handed out again, and each `done` hears `error`.
void mailbox_append_withdraw(Mailbox& box, int error);
// Whether the file was replaced or cut back since the slot was reserved.
bool mailbox_append_stale(const Mailbox& box, const AppendSlot& slot);
// Commits the staged messages of one box, or of every box. 0 or the errno
// value of the failure (each staged message's `done` is told either way).
int mailbox_commit_staged(Mailbox& box);
void mailbox_commit_staged();

// ---- the overview's upkeep ----------------------------------------------------

// A message's flags changed in memory: the change is appended to the
// overview with the next records written (or by mailbox_upkeep).
void mailbox_flags_changed(Mailbox& box, MessageRecord& message);
// Appends the pending flag changes now. 0 or an errno value.
int mailbox_overview_flush(Mailbox& box);
// Whether removals and flag changes have made the overview worth compacting.
bool mailbox_overview_stale(const Mailbox& box);
// One step of compacting the overview: the live records are written to a
// temporary file beside it (O_EXCL), a slice at a time until `deadline`,
// then synced and renamed over it. Appends, flag changes and removals made
// meanwhile are carried over (a removal starts the compaction again).
enum class CompactStep { idle, working, done, failed };
CompactStep mailbox_compact_step(Mailbox& box, std::chrono::steady_clock::time_point deadline);
// Background upkeep of every cached mailbox until `deadline`: pending flag
// changes written, stale overviews compacted. True while work remains.
bool mailbox_upkeep(std::chrono::steady_clock::time_point deadline);
// Whether a compaction is under way.
bool mailbox_upkeep_running();

// The separator line for a queue file's first line ("From sender date").
std::string mailbox_separator(std::string_view envelope_line, std::time_t when);
// The date of a separator line; kBadDate when the line is none.
std::time_t mailbox_separator_date(std::string_view line);
// Header lines delivery drops from arriving mail (they carry our own state).
bool mailbox_header_dropped(std::string_view line);
// The box a recipient address names by its sub-address ("ann_work@site" ->
// "work"); "inbox" for anything that is not a plain name.
std::string mailbox_box_for_address(std::string_view address);
// The overview text, as compacted. Beside the messages it records the next
// identifier ("#uidnext", behind "#uidvalidity" once one was chosen) and
// the mailbox's committed length ("#length", the
// sum of the messages' lengths; the last such line counts), so that what an
// interrupted append left behind the committed length is recognised.
// Later changes are appended as records: further "#msg" blocks, then
// "#uidnext" and "#length" again; "#flags <uid> <flags>" for a message's
// new flags, "#expunge <uid>" for a removed message. A reader that knows
// only the message blocks skips those lines (and, after a removal, finds
// the lengths do not add up and parses the mailbox instead). Inside a
// message block, "#text <dots>,<end_line>,<body_lines>" follows the four
// header values; a reader that does not know the line skips it too.
std::string mailbox_overview_text(const Mailbox& box);
// 0, or 1 for a text that is cut off or does not add up. Identifiers must
// rise from one message block to the next.
int mailbox_overview_parse(Mailbox& box, std::string_view text);
// The committed length of the mailbox: the sum of its messages' lengths
// (kept as messages come and go, not counted).
std::uint64_t mailbox_size(const Mailbox& box);
// Forgets every cached mailbox (tests).
void mailbox_cache_clear();

}  // namespace velmor
