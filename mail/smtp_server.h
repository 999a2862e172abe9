// The SMTP server (service 20): greets, reads commands and message data,
// and writes each accepted message as one file of the incoming queue. A
// message is acknowledged only once its file is synced and renamed into
// place, together with every other message finished in the same pass.
#pragma once

namespace velmor {

// Registers the service (its keys, accept rule and session) and the group
// commit that runs after every pass of the loop.
void smtp_register();

}  // namespace velmor
