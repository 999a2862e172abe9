#include "mail/recipient.h"

#include <ctime>
#include <optional>

#include "core/config.h"
#include "core/globals.h"
#include "core/log.h"
#include "core/textfile.h"
#include "core/util.h"
#include "mail/delivery.h"
#include "mail/queue.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

// Mail for postmaster that no alias and no user of that name took.
bool to_administrator(AliasSink& sink) {
  std::string admin = admin_address();
  if (admin.empty()) return false;
  std::string user = sink.local_user(admin);
  if (user.empty()) {
    sink.deliver_remote(admin);  // an administrator elsewhere
    return true;
  }
  if (str_iequals(user, "postmaster")) return false;  // admin.email names postmaster itself
  if (alias_resolve(alias_table(), user, sink)) return true;
  return sink.user_exists(user) && sink.deliver_local(user, user);
}

// Delivers nothing; says whether debatch would find a destination.
class Probe final : public QueueSink {
 public:
  bool deliver_local(std::string_view user, std::string_view to_address) override {
    return mailbox_recipient_known(to_address.empty() ? user : to_address);
  }
  void deliver_remote(std::string_view) override {}
  bool deliver_file(std::string_view) override { return true; }
  bool deliver_group(int) override { return may_mail_group(); }
  void loop_report() override {
    log_write("Mail alias: aliasing loop met while checking a recipient", logchan::errors);
  }
};

}  // namespace

RecipientResult route_recipient(std::string_view address, AliasSink& sink) {
  RecipientResult result;
  result.local = sink.local_user(address);
  if (result.local.empty()) {
    if (!alias_resolve(alias_table(), address, sink)) sink.deliver_remote(address);
    return result;
  }
  const std::string& local = result.local;
  if (alias_resolve(alias_table(), local, sink)) return result;
  if (sink.user_exists(local) && sink.deliver_local(local, address)) return result;
  if (str_iequals(local, "postmaster")) {
    if (!to_administrator(sink)) result.route = RecipientRoute::no_administrator;
    return result;
  }
  result.route = RecipientRoute::unknown_user;
  return result;
}

std::string QueueSink::local_user(std::string_view address) {
  return mail_local_user(address).value_or(std::string());
}

bool QueueSink::user_exists(std::string_view user) { return velmor::user_exists(user); }

bool QueueSink::read_list(std::string_view target, std::vector<std::string>& lines) {
  std::string list_path(target);
  if (!list_path.empty() && list_path.front() == '$') list_path.erase(0, 1);
  std::optional<std::string> text = read_text_file(list_path);
  if (!text) return false;
  for_each_line(*text, [&](std::string_view line) { lines.emplace_back(line.substr(0, 128)); });
  return true;
}

std::tm QueueSink::local_time() {
  std::time_t now = server_now ? server_now : std::time(nullptr);
  std::tm tm{};
  localtime_r(&now, &tm);
  return tm;
}

void QueueSink::set_sender(std::string_view sender) {
  sender_local = mail_local_user(sender).has_value();
  sender_group = group_of_sender(sender);
}

std::shared_ptr<const GroupOptions> group_of_sender(std::string_view sender) {
  return user_group(mail_local_user(sender).value_or(std::string()));
}

bool QueueSink::may_mail_group() const {
  return sender_local && sender_group && (sender_group->mail_flags & gflag::mail_override);
}

RecipientResult recipient_check(std::string_view address, std::string_view sender) {
  Probe probe;
  probe.set_sender(sender);
  return route_recipient(address, probe);
}

std::uint32_t group_message_limit(const std::shared_ptr<const GroupOptions>& group) {
  if (!group || (group->mail_flags & gflag::mail_override)) return 0;
  return group->size("mail.msg.size");
}

}  // namespace velmor
