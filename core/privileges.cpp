#include "core/privileges.h"

#include <grp.h>
#include <pwd.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <vector>

namespace velmor {

namespace {

struct Target {
  bool active = false;  // effective ids switched, root still to be given up
  uid_t uid = 0;
  gid_t gid = 0;
  std::string name;
};
Target target;

std::string failure(const std::string& what) {
  return "Cannot switch to server.user " + target.name + ": " + what + ": " + std::strerror(errno);
}

}  // namespace

std::string privileges_assume(const std::string& user) {
  target = Target{};
  if (user.empty()) return {};
  target.name = user;
  passwd pw{};
  passwd* found = nullptr;
  std::vector<char> buf(16384);
  if (getpwnam_r(user.c_str(), &pw, buf.data(), buf.size(), &found) != 0 || !found)
    return "Unknown server.user: " + user;
  uid_t real = getuid();
  if (real == pw.pw_uid && geteuid() == pw.pw_uid) return {};  // started as that user (systemd)
  if (geteuid() != 0) {
    errno = EPERM;
    return failure("not started as root");
  }
  if (initgroups(pw.pw_name, pw.pw_gid) != 0) return failure("initgroups");
  if (setegid(pw.pw_gid) != 0) return failure("setegid");
  if (seteuid(pw.pw_uid) != 0) return failure("seteuid");
  target.active = true;
  target.uid = pw.pw_uid;
  target.gid = pw.pw_gid;
  return {};
}

BindingPrivileges::BindingPrivileges() {
  // When this fails, binding a port below 1024 fails and says so.
  raised_ = target.active && geteuid() != 0 && seteuid(0) == 0;
}

BindingPrivileges::~BindingPrivileges() {
  if (raised_ && seteuid(target.uid) != 0) {
    // Still root: privileges_drop() finds out and refuses the start.
  }
}

std::string privileges_drop() {
  if (!target.active) return {};
  if (geteuid() != 0 && seteuid(0) != 0) return failure("seteuid(0)");
  if (setresgid(target.gid, target.gid, target.gid) != 0) return failure("setresgid");
  if (setresuid(target.uid, target.uid, target.uid) != 0) return failure("setresuid");
  uid_t r = 0, e = 0, s = 0;
  gid_t rg = 0, eg = 0, sg = 0;
  if (getresuid(&r, &e, &s) != 0 || getresgid(&rg, &eg, &sg) != 0) return failure("getresuid");
  if (r != target.uid || e != target.uid || s != target.uid || rg != target.gid || eg != target.gid ||
      sg != target.gid) {
    errno = EPERM;
    return failure("the ids did not change");
  }
  if (target.uid != 0 && (setuid(0) == 0 || seteuid(0) == 0)) {
    errno = EPERM;
    return failure("root could be taken back");
  }
  target.active = false;
  return {};
}

}  // namespace velmor
