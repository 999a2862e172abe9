// Child processes. A command is started with posix_spawn, which returns as
// soon as the child exists; the main loop reaps it later. The child starts
// with standard input from /dev/null, every descriptor above 2 closed and the
// default signal dispositions (the suite ignores SIGPIPE; a shell pipeline
// must not).
#include "core/process.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <map>
#include <utility>

extern char** environ;

namespace velmor {

namespace {
std::map<pid_t, std::function<void(int)>>& children() {
  static std::map<pid_t, std::function<void(int)>> c;
  return c;
}
}  // namespace

int run_shell(const std::string& command, std::function<void(int status)> done) {
  posix_spawn_file_actions_t actions;
  posix_spawnattr_t attr;
  if (posix_spawn_file_actions_init(&actions) != 0) return -1;
  if (posix_spawnattr_init(&attr) != 0) {
    posix_spawn_file_actions_destroy(&actions);
    return -1;
  }
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addclosefrom_np(&actions, 3);
  sigset_t defaults, empty;
  sigemptyset(&empty);
  sigemptyset(&defaults);
  for (int sig : {SIGPIPE, SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGCHLD, SIGIO, SIGURG})
    sigaddset(&defaults, sig);
  posix_spawnattr_setsigdefault(&attr, &defaults);
  posix_spawnattr_setsigmask(&attr, &empty);
  posix_spawnattr_setflags(&attr, POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETSIGMASK);

  std::string shell_command = command;
  char sh[] = "/bin/sh";
  char dash_c[] = "-c";
  char* argv[] = {sh, dash_c, shell_command.data(), nullptr};
  pid_t pid = -1;
  int rc = posix_spawn(&pid, "/bin/sh", &actions, &attr, argv, environ);
  posix_spawn_file_actions_destroy(&actions);
  posix_spawnattr_destroy(&attr);
  if (rc != 0) return -1;
  children().emplace(pid, std::move(done));
  return pid;
}

void process_poll() {
  auto& c = children();
  for (auto it = c.begin(); it != c.end();) {
    int status = 0;
    pid_t r = waitpid(it->first, &status, WNOHANG);
    if (r == 0) {
      ++it;
      continue;
    }
    // Ended (or, when r < 0, already reaped elsewhere: report it as failed).
    auto done = std::move(it->second);
    it = c.erase(it);
    if (done) done(r > 0 ? status : -1);
  }
}

}  // namespace velmor
