// Users and groups at start-up, on the control channel, and from the
// administrator's command line.
#pragma once

#include <string>

namespace velmor {

// Loads the user database (file.user.dbase) and the group options
// (file.user.groups) and fills the control-channel hooks (reload users,
// reload groups, change pass) and the default-group hook. A missing file is
// no failure: a missing user file leaves nobody able to log in, a missing
// groups file leaves no default group, so every service refuses. A file that
// exists but cannot be read ends start-up. 0, or the exit status.
int users_init();

// The administrator's command line, run instead of the daemon:
//   velmor [--root DIR] --adduser NAME [--password PW] [--full-name TEXT]
//          [--home DIR] [--group N]
//   velmor [--root DIR] --passwd NAME [--password PW]
//   velmor [--root DIR] --deluser NAME
// The password is read from standard input when not given (asked twice
// without echo on a terminal). The user file is changed in place, and a
// running daemon is told to reload it. -1 when argv holds none of these
// options; otherwise the exit status.
int users_command_line(int argc, char** argv);

// The demo user of a new installation: when the user file holds no user at
// all, adds "demo" with a random password, home `<root>/home/demo` (absolute)
// and group 0, and prints the login and password. 0, or 1 on a failure.
int users_make_demo(const std::string& users_file, const std::string& root);

}  // namespace velmor
