// The IMAP server (service 10): users read and keep their mail on the server.
// Mailbox names are relative to the user's home ("INBOX" is mail/inbox);
// sessions share a mailbox among themselves, each numbering its messages in
// its own view, and exclude POP3 (the in-use mark of mail/mailbox.h).
#pragma once

#include <string>
#include <string_view>

namespace velmor {

// Registers the service: its keys, accept rule and session.
void imap_register();

// Whether a client's mailbox name (or LIST pattern, with `pattern`) stays
// inside the home: no empty component nor one starting with "." (".." or
// ".forward"), no leading "/" or "~", no control characters, no "overview"
// component, no last component ending in "~" (an expunge's temporary file).
// `folder` allows one trailing "/" (CREATE of a folder).
bool imap_name_allowed(std::string_view name, bool pattern = false, bool folder = false);

}  // namespace velmor
