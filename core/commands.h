// Internal command words and the dial-up mail transfer sequence.
#pragma once

#include <string_view>

namespace velmor {

// Runs one internal command word ("connect", "disconnect", "popkick",
// "smtpkick", "newskick", "mailrescan", "maildebatch", "newsdebatch",
// "mailtransfer"), compared without regard to case. 1 = known word, 0 = not.
int internal_command(std::string_view word);

// One step of the mail transfer state machine (0 idle, 4 requested,
// 1 dialling, 5 link up, 2 started, 3 transferring); called by the main loop
// while mail_transfer_state is non-zero.
void mail_transfer_poll();

}  // namespace velmor
