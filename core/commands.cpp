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

// When the kick started no client at all (nothing to fetch or send), the
// transfer is over once this long has passed, so the link is not held open.
constexpr std::time_t kStartGrace = 60;
std::time_t transfer_started = 0;
bool transfer_started_nothing = false;

// False when the kicks are known to have started no client (a fetch kick
// that cannot tell counts as having started one).
bool start_transfer() {
  run(hooks.popkick);
  bool started = hooks.smtpkick && hooks.smtpkick();
  return started || hooks.popkick;
}

// A suite without the mail clients has nothing to wait for: the link is
// dropped at once rather than held for the grace.
bool no_mail_clients() { return !hooks.popkick && !hooks.smtpkick; }

}  // namespace

int internal_command(std::string_view word) {
  log_message("Internal command: ", word);
  static const std::pair<std::string_view, std::function<void()> SuiteHooks::*> words[] = {
      {"connect", &SuiteHooks::dial},          {"disconnect", &SuiteHooks::disconnect},
      {"popkick", &SuiteHooks::popkick},       {"smtpkick", nullptr},
      {"newskick", &SuiteHooks::newskick},     {"mailrescan", &SuiteHooks::mailrescan},
      {"maildebatch", &SuiteHooks::maildebatch}, {"newsdebatch", &SuiteHooks::newsdebatch},
      {"mailtransfer", nullptr},
  };
  for (const auto& [name, hook] : words) {
    if (!str_iequals(word, name)) continue;
    if (name == "connect") mail_transfer_state = 0;
    if (name == "mailtransfer") mail_transfer_state = 4;
    if (name == "smtpkick" && hooks.smtpkick) hooks.smtpkick();
    if (hook) run(hooks.*hook);
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
        run(hooks.dial);
      }
      break;
    case 5:
      log_message("Mail transfer - connected, and starting transfer");
      mail_transfer_state = 2;
      transfer_started = server_now;
      transfer_started_nothing = !start_transfer();
      break;
    case 2:
      if (count(hooks.pop_client_count) || count(hooks.smtp_client_count) || no_mail_clients() ||
          transfer_started_nothing || server_now - transfer_started >= kStartGrace)
        mail_transfer_state = 3;
      break;
    case 3:
      if (!count(hooks.smtp_client_count) && !count(hooks.pop_client_count) &&
          connection_count(svc::smtp) + connection_count(svc::smtp_client) == 0) {
        mail_transfer_state = 0;
        run(hooks.disconnect);
        log_message("Mail transfer complete, disconnecting");
      }
      break;
    default:  // 1: dialling; the resolver moves it to 5 when the link is proved
      break;
  }
}

}  // namespace velmor
