// Pure text rules of the mail queue and the SMTP server: envelope addresses,
// the relay decision, the banned-phrase list, and the receiver that turns the
// DATA stream of an SMTP client into the stored message. Nothing here touches
// files or sockets, so every rule is testable on its own.
#pragma once

#include <cstdint>
#include <ctime>
#include <string>
#include <string_view>
#include <vector>

#include "core/config.h"

namespace velmor {

// Longest envelope address accepted (the SMTP path limit).
inline constexpr std::size_t kMaxAddress = 256;
// Longest SMTP command line, without its CR LF (512 octets with it).
inline constexpr std::size_t kMaxCommandLine = 510;
// Distinct recipients one message may have.
inline constexpr std::size_t kMaxRecipients = 100;

// The address of an envelope line ("MAIL FROM:<a@b>", "RCPT TO: <c>",
// "POP3 MAIL FROM:<d>"): from the first ':' or '<', skipping ':', '<' and
// blanks, up to '>' (when it was bracketed) or else up to a blank, and never
// past CR or LF. The view points into `line`.
std::string_view envelope_address(std::string_view line);

// True for the argument of "MAIL FROM:..." / "RCPT TO:..." written the way
// a client may: `keyword` (case-insensitive) then ':' after optional blanks.
bool envelope_keyword(std::string_view argument, std::string_view keyword);

// The address of a MAIL or RCPT argument, checked so that the queue file
// line "RCPT TO:<address>" built from it reads back as the same address.
enum class PathResult {
  ok,
  syntax,     // not "<keyword>:...", or (with `allow_empty` false) no address
  too_long,   // longer than kMaxAddress
  bad_chars,  // blanks, control characters, '<' or '>' inside the address
};
struct EnvelopePath {
  PathResult result = PathResult::syntax;
  std::string_view address;     // points into the argument
  std::string_view parameters;  // what follows the path ("SIZE=1000 BODY=8BITMIME")
};
EnvelopePath parse_envelope_path(std::string_view argument, std::string_view keyword, bool allow_empty);

// The SIZE=n parameter of MAIL (the size the client declares). `absent`
// without one; `bad` when its value is not 1 to 20 digits. A value past
// what 64 bits hold reads as the largest.
enum class SizeParameter { absent, given, bad };
SizeParameter mail_size_parameter(std::string_view parameters, std::uint64_t& size);
// True when "RCPT TO:<address>" reads back as this same address.
bool envelope_address_fits(std::string_view address);

// The domain of an address (after its last '@'), or "" when it has none.
std::string_view address_domain(std::string_view address);

// May a peer hand us mail for a recipient outside the local domains? Only
// a peer listed in smtp.allow; while that list is empty, the site's own
// network: loopback and the private ranges.
bool relay_permitted(std::uint32_t peer_nbo, const AddressList& allow);
bool address_is_private(std::uint32_t peer_nbo);
// May a POP3 or IMAP client send its password in the clear? Always over TLS
// and from loopback or the private ranges; from anywhere else only while
// tls.plain.login allows it.
bool clear_login_allowed(std::uint32_t peer_nbo, bool secure);

// The phrases of a group's mail.filter: comma-separated, each optionally in
// single quotes, leading blanks skipped, at most 60 characters each.
std::vector<std::string> filter_phrases(std::string_view filter);

// Header dates: "%a, %d %b %Y %H:%M:%S +zzzz" in local time.
std::string mail_date_text(std::time_t t);

// The DATA phase of an SMTP transaction. Fed the bytes that follow the 354
// reply, it produces the message as it is stored: CR LF lines (a bare LF
// from a careless client counts as a line end), dot-stuffed lines kept as
// sent, a "Date:" header added at the end of the header when the message
// has none, and the terminator line "." stored as ".\r\n".
class MessageReceiver {
 public:
  // Consumes complete lines from `input` and appends their stored form to
  // `out`; returns the number of bytes consumed. A trailing incomplete line
  // stays unconsumed unless `force` is set (the input buffer is full), in
  // which case it is passed on as the first part of a long line.
  // `header_lines` collects every complete header line (for the mail log).
  std::size_t feed(std::string_view input, bool force, std::string& out,
                   std::string* header_lines = nullptr);
  bool done() const { return done_; }
  bool date_added() const { return date_added_; }
  std::time_t now = 0;  // for the generated Date header (0: time(nullptr))
  bool add_date = true;  // false: the header is kept as it came (fetched mail)

 private:
  void end_of_header(std::string& out);
  bool in_header_ = true;
  bool date_seen_ = false;
  bool date_added_ = false;
  bool at_line_start_ = true;
  bool done_ = false;
};

}  // namespace velmor
