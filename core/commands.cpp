// Internal command words, and the dial-up mail transfer: bring the link up,
// fetch and send the mail, and hang up when every mail connection has ended.
#include "core/commands.h"

#include <string>
#include <utility>

#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/network.h"
#include "core/util.h"

namespace velmor {

namespace {

// A subsystem that is not running has not filled its hook: nothing happens.
void run(const std::function<void()>& hook) {
  if (hook) hook();
}

int count(const std::function<int()>& hook) { return hook ? hook() : 0; }

// A mail client's kick: true when it started a connection.
bool kick(const std::function<bool()>& hook) { return hook && hook(); }

// When a kick reports a connection that never shows up, the transfer is
// over once this long has passed, so the link is not held open.
constexpr std::time_t kStartGrace = 60;
std::time_t transfer_started = 0;
// Whether the kicks of this transfer started any connection: with nothing
// to fetch or send there is nothing to wait for.
bool transfer_work = false;
// Whether a client was seen running: one that is counted from its kick on
// may be over (a fast server) before the next poll looks.
bool clients_seen = false;

bool clients_running() { return count(hooks.pop_client_count) || count(hooks.smtp_client_count); }

// A transfer waits this long for the link before it gives up.
constexpr std::time_t kLinkWait = 600;
std::time_t waiting_since = 0;

bool start_transfer() {
  bool pop = kick(hooks.popkick);
  bool smtp = kick(hooks.smtpkick);
  return pop || smtp;
}

}  // namespace

int internal_command(std::string_view word) {
  log_message("Internal command: ", word);
  static const std::pair<std::string_view, void (*)()> words[] = {
      {"connect", [] { mail_transfer_state = 0; run(hooks.dial); }},
      {"disconnect", [] { run(hooks.disconnect); }},
      {"popkick", [] { kick(hooks.popkick); }},
      {"smtpkick", [] { kick(hooks.smtpkick); }},
      {"newskick", [] { run(hooks.newskick); }},
      {"mailrescan", [] { run(hooks.mailrescan); }},
      {"maildebatch", [] { run(hooks.maildebatch); }},
      {"newsdebatch", [] { run(hooks.newsdebatch); }},
      {"mailtransfer", [] { mail_transfer_state = 4; }},
  };
  for (const auto& [name, action] : words) {
    if (!str_iequals(word, name)) continue;
    action();
    return 1;
  }
  return 0;
}

void mail_transfer_poll() {
  switch (mail_transfer_state) {
    case 4:
      if (link_up) {
        mail_transfer_state = 0;
        start_transfer();
      } else {
        log_message("Mail transfer - connecting...");
        mail_transfer_state = 1;
        waiting_since = server_now;
        run(hooks.dial);
      }
      break;
    case 1:
      // The resolver moves it to 5 when the link is proved. A dial that has
      // failed (or a line hung up meanwhile) will not bring the link, and
      // neither will a wait without end: the transfer goes idle, so that a
      // later request (mail.auto.send among them) can dial again.
      if (hooks.dialler_busy && !hooks.dialler_busy()) {
        mail_transfer_state = 0;
        log_message("Mail transfer - dial failed, going idle");
      } else if (server_now - waiting_since >= kLinkWait) {
        mail_transfer_state = 0;
        log_message("Mail transfer - link not up after 10 minutes, going idle");
        run(hooks.disconnect);
      }
      break;
    case 5:
      log_message("Mail transfer - connected, and starting transfer");
      mail_transfer_state = 2;
      transfer_started = server_now;
      transfer_work = start_transfer();
      clients_seen = clients_running();
      break;
    case 2:
      if (clients_seen || clients_running() || !transfer_work || server_now - transfer_started >= kStartGrace)
        mail_transfer_state = 3;
      break;
    case 3:
      if (!clients_running() &&
          connection_count(svc::smtp) + connection_count(svc::smtp_client) == 0) {
        mail_transfer_state = 0;
        run(hooks.disconnect);
        log_message("Mail transfer complete, disconnecting");
      }
      break;
    default:
      break;
  }
}

}  // namespace velmor
