// The POP3 server (service 30): users fetch and delete the messages of their
// inbox. Deletions are kept by the session and applied only at QUIT; a
// mailbox is used by one POP3 or IMAP session at a time (the in-use mark of
// mail/mailbox.h).
#pragma once

namespace velmor {

struct SocketRecord;

// Registers the service's handlers with the dispatcher.
void pop_server_init();

// The handlers, for the tests.
int pop_accept(SocketRecord& record);
int pop_read(SocketRecord& record, long n);
int pop_write(SocketRecord& record);
int pop_timer(SocketRecord& record);
void pop_release(SocketRecord& record);

}  // namespace velmor
