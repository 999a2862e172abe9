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
// running daemon is told to reload it.
//
// users_command_options takes these options out of argv, so the daemon's own
// parser never sees them: 0 none given; 1 a command waits for
// users_command_run(); 2 bad options (told on stderr).
int users_command_options(int& argc, char** argv);
// Runs the waiting command once `paths` is set. The exit status.
int users_command_run();

// The demo user of a new installation under paths.root: when the user file
// (file.user.dbase of the master file) holds no user at all, adds "demo" with
// a random password, home <root>/home/demo and group 0, and prints the login
// and password; the same line is kept in <root>/demo-login (mode 0600),
// which `--passwd demo` keeps current and `--deluser demo` removes. 0, or 1
// on a failure.
int users_make_demo();

}  // namespace velmor
