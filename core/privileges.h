// The suite's user (server.user). Started as root with it set, the suite
// works as that user from the configuration load on, so every file it makes
// is that user's; it takes root back only around each bind() of a listener
// (ports below 1024), and gives root up for good once they are open. A fault that remains costs that user,
// not the machine.
#pragma once

#include <string>

namespace velmor {

// Looks `user` up and, as root, takes its groups and its effective ids (the
// real and saved ids stay root's until privileges_drop). An empty name, or
// running as that user already, does nothing. "" = done; otherwise why not.
std::string privileges_assume(const std::string& user);
// Root's effective user id for the life of the object, for binding a port
// below 1024; nothing unless privileges_assume switched.
class BindingPrivileges {
 public:
  BindingPrivileges();
  ~BindingPrivileges();
  BindingPrivileges(const BindingPrivileges&) = delete;
  BindingPrivileges& operator=(const BindingPrivileges&) = delete;

 private:
  bool raised_ = false;
};
// Gives root up for good: group ids, then user ids (real, effective and
// saved), each checked, and checks that root cannot be taken back.
// "" = done or nothing to do; otherwise why not (the suite must not start).
std::string privileges_drop();

}  // namespace velmor
