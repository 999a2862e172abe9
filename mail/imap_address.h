// Address header values (From:, To:, ...) taken apart word by word: the
// IMAP envelope lists their addresses, and a read receipt finds where it
// goes by them.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace velmor {

enum class AddressToken {
  atom,    // a plain word: an address when it holds "@", else part of a name
  quoted,  // a double-quoted string (quotes and escapes removed): a name
  angle,   // an address in angle brackets (brackets removed)
  comma,   // the end of one address of a list
  end,     // the end of the value
};

// The next word of an address header value from `cursor`, which moves past
// it; the word goes to `word` (at most 253 characters; the rest of a longer
// one is skipped). Blanks are skipped; a parenthesised comment ends the word
// before it and is dropped; a line end followed by a blank continues the
// value (a folded header), a line end without one ends it.
AddressToken address_token_next(std::string_view value, std::size_t& cursor, std::string& word);

struct MailAddress {
  std::string name;     // the display name, its words joined by single blanks ("" when none)
  std::string mailbox;  // before the last "@"
  std::string host;     // after it
};

// The addresses of a value, in order: each comma-separated entry that holds
// an address (an angle address with "@", or a plain word with one) gives
// one, its other words making the name. Entries without one are left out.
std::vector<MailAddress> mail_address_list(std::string_view value);

}  // namespace velmor
