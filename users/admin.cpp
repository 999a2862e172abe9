// Users and groups at start-up, on the control channel and from the
// administrator's command line.
#include "users/admin.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <termios.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstring>
#include <iostream>
#include <optional>
#include <string_view>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/strfmt.h"
#include "core/util.h"
#include "users/groups.h"
#include "users/users.h"

namespace velmor {

namespace {

bool file_missing(const std::string& path) {
  struct stat st {};
  return path.empty() || (::stat(path.c_str(), &st) != 0 && errno == ENOENT);
}

// Loads the user or the groups file with `loader`. A missing file is no
// failure: `missing` says what follows from it.
int load_file(const ConfigText& key, int (*loader)(const std::string&), const char* missing,
              const char* unreadable) {
  const std::string& path = text_of(key);
  int rc = loader(path);
  if (rc == 1 && file_missing(path)) {
    log_message(missing, path);
    return 0;
  }
  if (rc != 0) log_message(unreadable, path);
  return rc;
}

int load_users() {
  return load_file(config.file_user_dbase, user_load, "User database file missing, nobody can log in: ",
                   "User database file cannot be read: ");
}

int load_groups() {
  return load_file(config.file_user_groups, groups_load,
                   "User group file missing, every service is refused: ",
                   "User group file cannot be read: ");
}

// "change pass": 1 when the old password is wrong, 2 changed, 0 failed.
int change_password(std::string_view name, std::string_view old_password,
                    std::string_view new_password) {
  if (user_check_password(name, old_password) != 0) {
    log_message("Password change refused for ", name);
    return 1;
  }
  const UserRecord* user = user_find(name);
  if (!user || new_password.empty()) return 0;
  std::string login = user->login;
  if (user_set_password(login, new_password) != UserChange::done) {
    log_message("Password change failed: ", user_last_error());
    return 0;
  }
  log_message("Password changed for ", login);
  return 2;
}

// ---- the command line -------------------------------------------------------

struct Request {
  enum class Action { none, add, passwd, remove } action = Action::none;
  std::string name;
  std::optional<std::string> password, full_name, home;
  int group = 0;
};

Request& request() {
  static Request r;
  return r;
}

// Fills `req` from one option and its value; an error text when it is wrong.
std::optional<std::string> take_option(std::string_view option, const char* value, Request& req) {
  if (!value) return strprintf("%.*s needs a value", static_cast<int>(option.size()), option.data());
  Request::Action action = option == "--adduser"  ? Request::Action::add
                           : option == "--passwd" ? Request::Action::passwd
                           : option == "--deluser" ? Request::Action::remove
                                                   : Request::Action::none;
  if (action != Request::Action::none) {
    if (req.action != Request::Action::none) return "give only one of --adduser, --passwd, --deluser";
    req.action = action;
    req.name = value;
  } else if (option == "--password") {
    req.password = value;
  } else if (option == "--full-name") {
    req.full_name = value;
  } else if (option == "--home") {
    req.home = value;
  } else {
    std::string_view g = value;
    auto [end, ec] = std::from_chars(g.data(), g.data() + g.size(), req.group);
    if (ec != std::errc() || end != g.data() + g.size()) return "--group needs a number";
  }
  return std::nullopt;
}

bool is_user_option(std::string_view arg) {
  for (std::string_view o : {"--adduser", "--passwd", "--deluser", "--password", "--full-name",
                             "--home", "--group"}) {
    if (arg == o) return true;
  }
  return false;
}

// Reads one line from the terminal without echo, after a prompt on stderr.
std::optional<std::string> read_hidden(const char* prompt) {
  std::fputs(prompt, stderr);
  std::fflush(stderr);
  termios saved {};
  bool restore = tcgetattr(STDIN_FILENO, &saved) == 0;
  if (restore) {
    termios quiet = saved;
    quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    tcsetattr(STDIN_FILENO, TCSAFLUSH, &quiet);
  }
  std::string line;
  bool got = static_cast<bool>(std::getline(std::cin, line));
  if (restore) tcsetattr(STDIN_FILENO, TCSAFLUSH, &saved);
  std::fputs("\n", stderr);
  if (!got) return std::nullopt;
  return line;
}

// The new password: from --password, else from standard input (asked twice
// on a terminal).
std::optional<std::string> new_password(const Request& req, std::string& error) {
  if (req.password) return req.password;
  std::string line;
  if (isatty(STDIN_FILENO)) {
    auto first = read_hidden("New password: ");
    auto second = first ? read_hidden("Retype new password: ") : std::nullopt;
    if (!first || !second) {
      error = "no password given";
      return std::nullopt;
    }
    if (*first != *second) {
      error = "the passwords differ";
      return std::nullopt;
    }
    line = *first;
  } else if (!std::getline(std::cin, line)) {
    error = "no password given on standard input";
    return std::nullopt;
  }
  if (!line.empty() && line.back() == '\r') line.pop_back();
  return line;
}

// A configured path: relative ones are under the installation folder.
std::string in_root(const std::string& path) {
  return !path.empty() && path[0] == '/' ? path : path_join(paths.root, path);
}

// Tells a running daemon to reload the user file: a datagram to the control
// socket. False when no daemon listens there.
bool tell_daemon(std::string_view command) {
  sockaddr_un addr {};
  addr.sun_family = AF_UNIX;
  if (paths.control.size() >= sizeof addr.sun_path) return false;
  std::memcpy(addr.sun_path, paths.control.data(), paths.control.size());
  int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  ssize_t sent = ::sendto(fd, command.data(), command.size(), 0,
                          reinterpret_cast<const sockaddr*>(&addr), sizeof addr);
  ::close(fd);
  return sent == static_cast<ssize_t>(command.size());
}

// The demo user's password is kept where demo.sh shows it from: written
// by --init with the user, kept current by --passwd demo, removed with the
// user. Only while the file exists: deleting it ends the keeping.
constexpr const char* kDemoUser = "demo";

std::string demo_login_path() { return path_join(paths.root, "demo-login"); }

std::string demo_login_text(std::string_view password) {
  return "Demo login: " + std::string(kDemoUser) + "  password: " + std::string(password) + "\n";
}

int fail(const std::string& text) {
  std::fprintf(stderr, "velmor: %s\n", text.c_str());
  return 1;
}

}  // namespace

int users_init() {
  log_message("Loading user database");
  if (int rc = load_users(); rc != 0) {
    std::printf("User database init failed\n");
    return rc;
  }
  log_message("Loading user group options");
  if (int rc = load_groups(); rc != 0) {
    std::printf("User group options init failed\n");
    return rc;
  }
  hooks.reload_users = [] {
    log_message("Reloading user database");
    return load_users();
  };
  hooks.reload_groups = [] {
    log_message("Reloading user group options");
    return load_groups();
  };
  hooks.change_password = change_password;
  hooks.default_group = group_default;
  return 0;
}

int users_command_options(int& argc, char** argv) {
  Request& req = request();
  int kept = 1;
  bool any = false;
  for (int i = 1; i < argc; ++i) {
    std::string_view arg = argv[i];
    if (!is_user_option(arg)) {
      argv[kept++] = argv[i];
      continue;
    }
    any = true;
    const char* value = i + 1 < argc ? argv[++i] : nullptr;
    if (auto error = take_option(arg, value, req)) {
      fail(*error);
      return 2;
    }
  }
  argc = kept;
  argv[kept] = nullptr;
  if (!any) return 0;
  if (req.action == Request::Action::none) {
    fail("--password, --full-name, --home and --group go with --adduser or --passwd");
    return 2;
  }
  return 1;
}

int users_command_run() {
  const Request& req = request();
  if (config_load() != 0) return 1;
  if (::chdir(paths.root.c_str()) != 0) {
    return fail(strprintf("cannot enter %s: %s", paths.root.c_str(), std::strerror(errno)));
  }
  const std::string& users_path = text_of(config.file_user_dbase);
  if (users_path.empty()) return fail("file.user.dbase is not set in the configuration");
  if (int rc = user_load(users_path); rc != 0 && !(rc == 1 && file_missing(users_path))) {
    return fail(strprintf("cannot read the user file %s", users_path.c_str()));
  }

  std::string error;
  const UserRecord* user = user_find(req.name);
  switch (req.action) {
    case Request::Action::add: {
      std::string home = in_root(req.home.value_or(path_join("home", req.name)));
      auto password = new_password(req, error);
      if (!password) return fail(error);
      if (password->empty()) return fail("the password is empty");
      if (user_add(req.name, *password, req.full_name.value_or(""), home, req.group) != UserChange::done)
        return fail(user_last_error());
      make_path(home);
      std::printf("Added user %s (home %s, group %d)\n", req.name.c_str(), home.c_str(), req.group);
      if (groups_load(text_of(config.file_user_groups)) == 0 && !group_find(req.group) && group_default()) {
        std::printf("Group %d has no option set: the default group applies\n", req.group);
      }
      break;
    }
    case Request::Action::passwd: {
      if (!user || !str_iequals(user->login, req.name)) return fail("no user " + req.name);
      std::string login = user->login;
      auto password = new_password(req, error);
      if (!password) return fail(error);
      if (password->empty()) return fail("the password is empty");
      if (user_set_password(login, *password) != UserChange::done) return fail(user_last_error());
      std::printf("Changed the password of %s\n", login.c_str());
      if (login == kDemoUser && file_is_regular(demo_login_path()) &&
          file_write_atomic(demo_login_path(), demo_login_text(*password), false, 0600) != 0)
        std::printf("Couldn't update %s: it holds the old password\n", demo_login_path().c_str());
      break;
    }
    case Request::Action::remove:
      if (user_remove(req.name) != UserChange::done) return fail(user_last_error());
      std::printf("Removed user %s (the home folder is left as it is)\n", req.name.c_str());
      if (req.name == kDemoUser) ::unlink(demo_login_path().c_str());
      break;
    case Request::Action::none:
      break;
  }
  if (tell_daemon("reload users")) {
    std::printf("The running suite reloads the user database\n");
  } else {
    std::printf("No suite runs at %s: it reads the change when it starts\n", paths.control.c_str());
  }
  return 0;
}

int users_make_demo() {
  config_load_file(paths.master());
  const std::string& configured = text_of(config.file_user_dbase);
  std::string users_file = in_root(configured.empty() ? "config/users" : configured);
  int rc = user_load(users_file);
  if (rc != 0 && !(rc == 1 && file_missing(users_file))) {
    std::printf("Couldn't read the user file %s\n", users_file.c_str());
    return 1;
  }
  if (!user_list().empty()) return 0;  // an installation that has users keeps them
  std::string password = random_password(12);
  if (password.size() != 12) {
    std::printf("No random source for the demo password\n");
    return 1;
  }
  std::string home = in_root("home/demo");
  if (user_add(kDemoUser, password, "Demo User", home, 0) != UserChange::done) {
    std::printf("Couldn't add the demo user: %s\n", user_last_error().c_str());
    return 1;
  }
  make_path(home);
  std::string line = demo_login_text(password);
  std::fputs(line.c_str(), stdout);
  if (file_write_atomic(demo_login_path(), line, false, 0600) != 0)
    std::printf("Couldn't write %s: keep the password above\n", demo_login_path().c_str());
  return 0;
}

}  // namespace velmor
