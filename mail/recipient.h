// Where an envelope recipient goes: through the alias table, into a local
// user's mailbox, to the administrator (postmaster), or out. Debatch
// delivers along the route; the SMTP server asks the same route at RCPT
// through a sink that delivers nothing, so that it never accepts mail that
// could only bounce.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "mail/alias.h"

namespace velmor {

struct GroupOptions;

enum class RecipientRoute {
  taken,             // an alias, a mailbox or the outgoing queue takes it
  unknown_user,      // a local address that no alias and no user answers
  no_administrator,  // postmaster, and nobody to take the administrator's mail
};

struct RecipientResult {
  RecipientRoute route = RecipientRoute::taken;
  std::string local;  // the local name, for a local address
};

// Routes `address`. A local address goes through the alias table, then to
// the user's mailbox; postmaster at every local domain (and without one)
// then goes to the administrator: the local user of admin.email, or
// admin.email itself when it is an outside address. Anything else is an
// outside address: through the alias table, else out.
RecipientResult route_recipient(std::string_view address, AliasSink& sink);

// The part of a sink that reading the world needs (users, list files, the
// clock) and the sender's right to mail a whole group ("+N"), shared by
// debatch and the RCPT check.
class QueueSink : public AliasSink {
 public:
  std::string local_user(std::string_view address) override;
  bool user_exists(std::string_view user) override;
  bool read_list(std::string_view target, std::vector<std::string>& lines) override;
  std::tm local_time() override;

  // The sender as debatch judges it: local or not, and its group (the
  // default group for an outside sender).
  void set_sender(std::string_view sender);
  bool sender_local = false;
  std::shared_ptr<const GroupOptions> sender_group;
  // Group mail is for senders whose group may override the mail limits.
  bool may_mail_group() const;
};

// The RCPT check: `address` routed for `sender` without delivering
// anything. A loop in the alias table is logged (debatch reports it).
RecipientResult recipient_check(std::string_view address, std::string_view sender);

// The group whose limits apply to a sender: a local user's, else the
// default group (every stranger's). nullptr when no groups are loaded.
std::shared_ptr<const GroupOptions> group_of_sender(std::string_view sender);

// The largest message (the whole queue file) a group may send; 0 = no limit
// (none set, or the group overrides the mail limits).
std::uint32_t group_message_limit(const std::shared_ptr<const GroupOptions>& group);

}  // namespace velmor
