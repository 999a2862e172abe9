// IMAP message rendering: the FETCH item list parsed, and one message's
// FETCH response built from its overview record and the mailbox file. It
// knows no sockets: the response goes to an ImapSink as text and as ranges
// of the mailbox file, so a large literal is streamed from the file rather
// than copied into memory. It also reads a message's text for SEARCH, and
// renders IMAP strings and flag lists for the session.
//
// The text a client is given is the stored message behind its "From "
// separator line, without the "." line that ends it (the last line keeps its
// CR LF), and with the dots of transmission form taken out. RFC822.SIZE is
// its length, and every literal counts exactly the bytes that follow it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "mail/mailbox.h"

namespace velmor {

class ByteSource;  // mail/mailfile.h

// Where a response goes.
class ImapSink {
 public:
  virtual ~ImapSink() = default;
  virtual void text(std::string_view bytes) = 0;
  // `length` bytes of the mailbox file from `offset`. With `unstuff` the
  // range begins at a line start, and a "." that begins a line in it is not
  // sent (fewer bytes go out; the literal counted them already).
  virtual void file_range(std::uint64_t offset, std::uint64_t length, bool unstuff) = 0;
};

// A sink that keeps what it is given: the session renders into one, and
// passes it on (replay) once the rendering went well; tests and small
// results read it out as one string.
class ImapBuffer final : public ImapSink {
 public:
  void text(std::string_view bytes) override;
  void file_range(std::uint64_t offset, std::uint64_t length, bool unstuff) override;
  void replay(ImapSink& to) const;
  // The output with its ranges read from `file`; nullopt when a range could
  // not be read whole.
  std::optional<std::string> flatten(ByteSource& file) const;
  bool empty() const { return pieces_.empty(); }
  void clear();

 private:
  struct Piece {
    std::string text;
    std::uint64_t offset = 0, length = 0;
    bool is_range = false, unstuff = false;
  };
  std::vector<Piece> pieces_;
};

// The plain text of `length` stored bytes from `offset` (which begins a
// line) appended to `out`: a "." that begins a line is dropped. False when
// the source ends first or fails.
bool imap_unstuff_append(ByteSource& file, std::uint64_t offset, std::uint64_t length, std::string& out);

// ---- strings and flags ---------------------------------------------------------

// `text` as an IMAP string: quoted (with "\" before "\" and "\"") when it
// holds only 7-bit characters other than NUL, CR and LF, else a literal
// ("{n}\r\n" and the bytes).
void imap_append_string(std::string& out, std::string_view text);
// The same, or NIL when there is no text.
void imap_append_nstring(std::string& out, std::optional<std::string_view> text);
// A flag list: "(\Seen \Answered \Flagged \Deleted \Draft \Recent)", with
// the flags that are set, in that order.
std::string imap_flag_list(std::uint32_t flags);
// The bit of a flag name ("\Seen", any case); 0 for a name we do not keep.
std::uint32_t imap_flag_bit(std::string_view name);

// ---- the FETCH item list ---------------------------------------------------------

enum class FetchAtt {
  flags,
  internaldate,
  rfc822_size,
  envelope,
  body,           // BODY without a section: the structure without extension data
  bodystructure,  // with it
  uid,
  section,        // BODY[...], BODY.PEEK[...], RFC822, RFC822.HEADER, RFC822.TEXT
};

struct FetchSection {
  enum class Kind { all, header, fields, fields_not, text, mime };
  std::vector<std::uint32_t> part;  // "1.2" is {1, 2}; empty for the message itself
  Kind kind = Kind::all;
  std::vector<std::string> fields;  // HEADER.FIELDS names as the client wrote them
};

struct FetchItem {
  // How a section item is named in the response.
  enum class Name { body, rfc822, rfc822_header, rfc822_text };
  FetchAtt att = FetchAtt::flags;
  FetchSection section;
  Name name = Name::body;
  bool peek = false;  // leaves \Seen alone
  bool partial = false;
  std::uint32_t start = 0, count = 0;  // <start.count>
};

struct FetchRequest {
  std::vector<FetchItem> items;  // ALL, FAST and FULL are expanded
  // Whether fetching sets \Seen (a BODY[...] without .PEEK, RFC822, RFC822.TEXT).
  bool sets_seen() const;
};

enum class FetchParse { ok, bad };
// Parses the items of a FETCH command: the text after the sequence set and
// its blank, without the line end. One item, a macro (ALL, FAST, FULL) or
// a parenthesised list; bad for anything malformed (the session answers
// BAD and renders nothing). HEADER.FIELDS names are atoms or quoted strings.
FetchParse imap_fetch_parse(std::string_view text, FetchRequest& request);

// ---- rendering ---------------------------------------------------------------------

struct FetchTarget {
  // The message's record. Counts of its text that an old overview lacked
  // are made and kept in it.
  MessageRecord& message;
  std::uint64_t offset = 0;    // where the message starts in the mailbox file
  std::uint32_t sequence = 0;  // its message sequence number
  std::uint32_t flags = 0;     // the flags to show (the session's view, \Recent included)
};

struct FetchOptions {
  bool uid_mode = false;      // UID FETCH: every response carries the UID
  bool may_set_seen = true;   // false for a mailbox selected with EXAMINE
};

enum class FetchStatus {
  done,
  // The message does not lie within the file (or reading it failed): nothing
  // should be sent for it. Output may have been written; a session that
  // rendered into an ImapBuffer simply drops it.
  unreadable,
};

struct FetchResult {
  FetchStatus status = FetchStatus::done;
  // The fetch read the message: the session marks it seen
  // (mailbox_mark_seen); the response already shows \Seen.
  bool seen_set = false;
};

// Writes "* <sequence> FETCH (...)\r\n" for one message.
FetchResult imap_fetch_render(const FetchRequest& request, FetchTarget& target, ByteSource& file,
                              const FetchOptions& options, ImapSink& out);

// ---- what SEARCH asks -----------------------------------------------------------

// RFC822.SIZE: the length of the text a client is given (LARGER, SMALLER).
// nullopt when the message cannot be read.
std::optional<std::uint64_t> imap_message_size(ByteSource& file, MessageRecord& message, std::uint64_t offset);
// A message's text as SEARCH compares it, folded to one case (utf8_fold):
// its header fields with the values unfolded and their encoded words
// decoded, and the text of its body (the text parts and attached messages,
// their transfer encoding undone, in UTF-8). Bounded: kSearchHeaderKeep of
// the header and kSearchBodyKeep of the body are kept; attachments that are
// not text are not read at all.
inline constexpr std::size_t kSearchHeaderKeep = 256 * 1024;
inline constexpr std::size_t kSearchBodyKeep = 2 * 1024 * 1024;
struct SearchText {
  std::vector<std::pair<std::string, std::string>> fields;  // name as written, value folded
  std::string body;
  bool header_read = false, body_read = false;
  std::uint64_t cost = 0;  // bytes read and made so far
};
// Reads what `out` lacks: the header fields, and with `with_body` the body
// text. False when the message cannot be read.
bool imap_search_text(ByteSource& file, MessageRecord& message, std::uint64_t offset, bool with_body,
                      SearchText& out);

}  // namespace velmor
