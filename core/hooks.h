// The core calls into the other subsystems only through these hooks, which
// each subsystem fills when it starts (daemon/main.cpp wires them). A hook that
// no subsystem has filled yet does nothing: the command is accepted and
// ignored until that subsystem exists.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

namespace velmor {

struct GroupOptions;

struct SuiteHooks {
  // Internal command words (control channel, scheduler, administration).
  std::function<void()> dial;          // "connect"
  std::function<void()> disconnect;    // "disconnect"
  // The mail clients' kicks: true when the kick started a connection (with
  // nothing to fetch or send, a mail transfer need not wait for one).
  std::function<bool()> popkick;       // POP3 client fetch check now
  std::function<bool()> smtpkick;      // SMTP client on the outgoing queue now
  std::function<void()> newskick;      // news fetch for all servers
  std::function<void()> mailrescan;    // rescan incoming, then outgoing
  std::function<void()> maildebatch;   // debatch one incoming file now
  std::function<void()> newsdebatch;

  // Control channel.
  std::function<int()> reload_users;
  std::function<int()> reload_groups;
  // 1 = old password wrong; 2 = changed; 0 = the change failed.
  std::function<int(std::string_view user, std::string_view old_password,
                    std::string_view new_password)> change_password;
  // The whole listing, from its "start mq" line to its "end mq" ("end nq")
  // line; each datagram is handed to `send`.
  std::function<void(const std::function<void(std::string_view)>& send)> list_mail_queue;
  std::function<void(const std::function<void(std::string_view)>& send)> list_news_queue;
  std::function<std::size_t()> outgoing_mail_count;
  // Messages of the incoming queue not yet delivered, and how many of them
  // wait for a later try after a temporary failure.
  std::function<std::pair<std::size_t, std::size_t>()> incoming_mail_count;
  // "lookup NAME": resolves an address and calls `done` once, when the
  // lookup ends, with the dotted address or an empty text when it failed.
  std::function<void(std::string_view name, std::function<void(std::string_view address)> done)> lookup;

  // Connection counts of the mail clients, for the mail transfer sequence.
  std::function<int()> pop_client_count;
  std::function<int()> smtp_client_count;

  // The group set every new socket record starts with (none until the
  // groups are loaded).
  std::function<std::shared_ptr<const GroupOptions>()> default_group;

  // The dial-up link, between the dialler and the link monitor.
  // Filled by the dialler: hangs up when the link has stayed down too long
  // while on line. The link monitor runs it on its polls and when a response
  // first proves the link (before setting link_up).
  std::function<void()> link_watch;
  // Filled by the dialler: true while it dials, runs its script or is on
  // line; false once a dial has failed or the line was hung up.
  std::function<bool()> dialler_busy;
  // Filled by the link monitor. The dialler's script has ended: forget when
  // the link was declared broken, so probing starts at once.
  std::function<void()> link_probe_restart;
  // The dialler has hung up (link_up cleared, link_probe_due set): the probe
  // counter becomes 2.
  std::function<void()> link_hung_up;
};
extern SuiteHooks hooks;

}  // namespace velmor
