// The POP3 server (service 30): users fetch and delete the messages of their
// inbox. Deletions are kept by the session and applied only at QUIT; a
// mailbox is used by one POP3 or IMAP session at a time (the in-use mark of
// mail/mailbox.h, keyed by the connection's id).
#pragma once

namespace velmor {

// Registers the service: its keys, accept rule and session.
void pop_register();

}  // namespace velmor
