// velmor: the daemon. Start-up, the main loop and shutdown.
//
// This is the one file that knows every subsystem: start-up brings them up in
// order, the main loop runs their polls every half second, and shutdown takes
// them down in order. Each subsystem wires itself in at the marked places.
#include <arpa/inet.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <exception>
#include <string>
#include <string_view>

#include "core/commands.h"
#include "core/config.h"
#include "core/control.h"
#include "core/defaults.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/mime.h"
#include "core/privileges.h"
#include "core/process.h"
#include "core/scheduler.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "dialler/dialin.h"
#include "dialler/dialler.h"
#include "dns/service.h"
#include "mail/imap_server.h"
#include "mail/pop_server.h"
#include "mail/queue.h"
#include "mail/smtp_server.h"
#include "users/admin.h"

namespace velmor {
namespace {

// ---- command line -----------------------------------------------------------

constexpr const char* kUsage =
    "usage: velmor [--root DIR] [--pid-file PATH] [--control PATH] [--bind ADDR]\n"
    "              [--init [--standard-ports] [--user NAME]] [--help] [--version]\n"
    "       velmor [--root DIR] --adduser NAME [--password PW] [--full-name TEXT]\n"
    "              [--home DIR] [--group N]\n"
    "       velmor [--root DIR] --passwd NAME [--password PW]\n"
    "       velmor [--root DIR] --deluser NAME\n"
    "\n"
    "  --root DIR        the installation folder (default /usr/local/velmor)\n"
    "  --pid-file PATH   where the process id is written (default DIR/run/velmor.pid)\n"
    "  --control PATH    the control socket (default DIR/run/control)\n"
    "  --bind ADDR       listen on this IPv4 address only (default: every address)\n"
    "  --init            write the default installation into the root folder and exit;\n"
    "                    files that exist are left alone. Services listen on unprivileged\n"
    "                    ports (SMTP 2525, POP3 1110, IMAP 1143, NNTP 1119, web 8000)\n"
    "  --standard-ports  with --init: SMTP 25, POP3 110, IMAP 143, NNTP 119, web 80\n"
    "  --user NAME       with --init: server.user, the user the suite runs as once its\n"
    "                    listeners are bound when started as root\n"
    "  --adduser NAME    add a user (home DIR/home/NAME, group 0 unless given); without\n"
    "                    --password the password is read from standard input\n"
    "  --passwd NAME     set a user's password; --deluser NAME removes a user. A running\n"
    "                    suite is told to reload the user file\n"
    "  --help            this text\n"
    "  --version         the version\n";

struct Options {
  bool init = false;
  bool standard_ports = false;
  std::string user;  // --init --user
};

std::string absolute(const std::string& path) {
  if (path.empty() || path[0] == '/') return path;
  std::string cwd(4096, '\0');
  while (!getcwd(cwd.data(), cwd.size())) {
    if (errno != ERANGE) return path;
    cwd.resize(cwd.size() * 2);
  }
  cwd.resize(std::strlen(cwd.c_str()));
  return path_join(cwd, path);
}

// Fills `paths` from the command line. -1 = go on; otherwise the exit status.
int parse_command_line(int argc, char** argv, Options& options) {
  std::string root, pid_file, control;
  for (int i = 1; i < argc; ++i) {
    std::string_view arg = argv[i];
    auto value = [&](std::string& out) {
      if (i + 1 >= argc || argv[i + 1][0] == '\0') return false;
      out = argv[++i];
      return true;
    };
    bool ok = true;
    if (arg == "--help" || arg == "-h") {
      std::fputs(kUsage, stdout);
      return 0;
    } else if (arg == "--version") {
      std::printf("velmor %s %s\n", kVersion, kPlatform);
      return 0;
    } else if (arg == "--root") {
      ok = value(root);
    } else if (arg == "--pid-file") {
      ok = value(pid_file);
    } else if (arg == "--control") {
      ok = value(control);
    } else if (arg == "--bind") {
      ok = value(paths.bind_address);
      in_addr a{};
      if (ok && inet_pton(AF_INET, paths.bind_address.c_str(), &a) != 1) {
        std::fprintf(stderr, "velmor: --bind needs an IPv4 address, not '%s'\n", paths.bind_address.c_str());
        return 2;
      }
    } else if (arg == "--init") {
      options.init = true;
    } else if (arg == "--standard-ports") {
      options.standard_ports = true;
    } else if (arg == "--user") {
      ok = value(options.user);
      if (ok && options.user.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789._-") !=
                    std::string::npos) {
        std::fprintf(stderr, "velmor: --user needs a user name, not '%s'\n", options.user.c_str());
        return 2;
      }
    } else {
      std::fprintf(stderr, "velmor: unknown option '%s'\n%s", argv[i], kUsage);
      return 2;
    }
    if (!ok) {
      std::fprintf(stderr, "velmor: %s needs a value\n%s", argv[i], kUsage);
      return 2;
    }
  }
  if ((options.standard_ports || !options.user.empty()) && !options.init) {
    std::fprintf(stderr, "velmor: --standard-ports and --user go with --init\n");
    return 2;
  }
  if (!root.empty()) {
    root = absolute(root);
    while (root.size() > 1 && root.back() == '/') root.pop_back();
    paths.root = root;
  }
  // Both live in the installation's own run/, which belongs to the suite:
  // nobody else can put a socket or a pid file there first.
  paths.pid_file = paths.root + "/run/velmor.pid";
  paths.control = paths.root + "/run/control";
  if (!pid_file.empty()) paths.pid_file = absolute(pid_file);
  if (!control.empty()) paths.control = absolute(control);
  paths.tmp_dir = paths.root + "/tmp";
  return -1;
}

// ---- the default installation ---------------------------------------------

void replace_all(std::string& text, std::string_view from, std::string_view to) {
  for (std::size_t at = 0; (at = text.find(from, at)) != std::string::npos; at += to.size())
    text.replace(at, from.size(), to);
}

// Writes every embedded default file that does not exist yet, with the host
// name and the ports filled in, and makes the folders the suite uses.
int init_installation(const Options& options) {
  const bool standard = options.standard_ports;
  const std::pair<std::string_view, std::string> values[] = {
      {"@HOSTNAME@", host_name()},
      {"@SMTP_PORT@", standard ? "25" : "2525"},
      {"@POP_PORT@", standard ? "110" : "1110"},
      {"@IMAP_PORT@", standard ? "143" : "1143"},
      {"@NNTP_PORT@", standard ? "119" : "1119"},
      {"@WEB_PORT@", standard ? "80" : "8000"},
      {"@SERVER_USER@", options.user},
  };
  make_path(paths.root);
  if (!file_is_directory(paths.root)) {
    std::printf("Cannot make the installation folder %s: %s\n", paths.root.c_str(), std::strerror(errno));
    return 1;
  }
  for (const char* dir : {"logs", "tmp", "mail/in", "mail/out", "mail/odd", "home"})
    make_path(path_join(paths.root, dir));
  ::mkdir(path_join(paths.root, "run").c_str(), 0750);  // the control socket's folder

  int written = 0, kept = 0;
  auto install = [&](std::string_view relative, std::string_view data) {
    std::string path = path_join(paths.root, relative);
    if (file_size(path) >= 0) {
      ++kept;
      return 0;
    }
    std::string text(data);
    for (const auto& [from, to] : values) replace_all(text, from, to);
    make_parent_dirs(path);
    if (int error = file_write_atomic(path, text, false, 0640)) {
      std::printf("Cannot write %s: %s\n", path.c_str(), std::strerror(error));
      return 1;
    }
    ++written;
    return 0;
  };
  for (const auto& f : default_files()) {
    if (install(f.path, f.data)) return 1;
    // The master file starts as a copy of its template.
    if (f.path == "config/templates/master" && install("config/master", f.data)) return 1;
  }
  // Later subsystems add their own first-run steps here (sample users, ...).
  if (users_make_demo() != 0) return 1;
  std::printf("Velmor installation in %s: %d files written, %d left as they were\n", paths.root.c_str(), written,
              kept);
  return 0;
}

// ---- signals ----------------------------------------------------------------

// The main-log stamp of the current second, prepared by the main loop so that
// the crash handler can use it without calling anything unsafe.
std::array<char, 48> crash_stamp{};

void refresh_crash_stamp() {
  std::tm local{};
  std::time_t now = server_now;
  localtime_r(&now, &local);
  std::array<char, 48> fresh{};
  std::strftime(fresh.data(), fresh.size() - 1, "%H:%M:%S, %d %b -> ", &local);
  crash_stamp = fresh;
}

extern "C" void quit_handler(int) { quit_flag = 1; }

// Only async-signal-safe calls: the line is built by hand, written to the
// console and appended to channel 1's file with open/write/close.
extern "C" void segv_handler(int) {
  int saved_errno = errno;
  char line[96];
  std::size_t n = 0;
  auto add = [&](const char* text) {
    while (*text && n < sizeof line - 1) line[n++] = *text++;
  };
  add(crash_stamp.data());
  std::size_t text_start = n;
  add("+*+*+*+*+*+* seg fault:");
  char digits[12];
  std::size_t d = 0;
  std::uint32_t code = progress_code.load();
  do {
    digits[d++] = static_cast<char>('0' + code % 10);
    code /= 10;
  } while (code && d < sizeof digits);
  while (d > 0 && n < sizeof line - 1) line[n++] = digits[--d];
  line[n++] = '\n';
  ssize_t ignored = ::write(STDOUT_FILENO, line + text_start, n - text_start);
  if (const char* path = log_error_channel_path()) {
    int fd = ::open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0660);
    if (fd >= 0) {
      ignored = ::write(fd, line, n);
      ::close(fd);
    }
  }
  (void)ignored;
  progress_code = 0;
  struct sigaction dfl {};
  dfl.sa_handler = SIG_DFL;
  sigemptyset(&dfl.sa_mask);
  sigaction(SIGSEGV, &dfl, nullptr);
  quit_flag = 1;
  errno = saved_errno;
}

// Installed before any socket or file exists. A send to a closed peer then
// fails with EPIPE instead of ending the process; the interrupted wait of the
// main loop sees quit_flag at once.
void set_signal_handlers() {
  struct sigaction sa {};
  sigemptyset(&sa.sa_mask);
  sa.sa_handler = quit_handler;
  for (int s : {SIGHUP, SIGINT, SIGQUIT, SIGTERM}) sigaction(s, &sa, nullptr);
  sa.sa_handler = segv_handler;
  sigaction(SIGSEGV, &sa, nullptr);
  sa.sa_handler = SIG_IGN;
  for (int s : {SIGPIPE, SIGIO, SIGURG}) sigaction(s, &sa, nullptr);
}

bool pid_file_written = false;

// ---- main loop --------------------------------------------------------------

constexpr std::int64_t kTickMs = 500;

std::int64_t monotonic_ms() {
  return std::chrono::duration_cast<std::chrono::milliseconds>(
             std::chrono::steady_clock::now().time_since_epoch())
      .count();
}

// Runs one poll of the main loop. An exception from it skips the rest of
// that poll, is logged, and the loop goes on.
template <class F>
void guarded_poll(const char* name, F&& poll_step) {
  try {
    poll_step();
  } catch (const std::exception& e) {
    log_write(std::string("The ") + name + " poll failed: " + e.what(), logchan::errors, kLogUnbuffered);
  } catch (...) {
    log_write(std::string("The ") + name + " poll failed", logchan::errors, kLogUnbuffered);
  }
}

// Waits for socket readiness, or for a signal, until the next tick.
void wait_until(std::int64_t tick) {
  std::int64_t ms = std::max<std::int64_t>(0, tick - monotonic_ms());
  guarded_poll("dispatcher", [ms] { net_pass(static_cast<int>(ms)); });  // a signal ends the wait early
}

// Every half second; each poll returns quickly.
void tick() {
  if (mail_transfer_state) guarded_poll("mail transfer", mail_transfer_poll);
  guarded_poll("mail", mail_poll);
  guarded_poll("logger", log_poll);
  guarded_poll("scheduler", schedule_poll);
  guarded_poll("dialler", dialler_poll);
  guarded_poll("child process", process_poll);
  // resends, time-outs, and the link monitor while the link is down or in doubt
  guarded_poll("resolver", dns_poll);
  guarded_poll("connection", net_tick);  // idle time-outs, the services' tick hooks
}

void poll() {
  std::int64_t next_tick = monotonic_ms() + kTickMs;
  bool busy = false;  // background work waits: the dispatcher only looks for ready I/O
  while (!quit_flag) {
    progress_code = 1;
    server_now = std::time(nullptr);
    progress_code = 0;
    wait_until(busy ? monotonic_ms() : next_tick);
    progress_code = 1;
    server_now = std::time(nullptr);
    std::int64_t now = monotonic_ms();
    if (now >= next_tick && !quit_flag) {
      // After a long stall the ticks start again from now rather than
      // running several at once.
      next_tick = now - next_tick > kTickMs ? now + kTickMs : next_tick + kTickMs;
      refresh_crash_stamp();
      tick();
    }
    busy = false;
    if (hooks.background && !quit_flag) guarded_poll("background", [&busy] { busy = hooks.background(); });
  }
  // Told that the suite stops, background work settles what it holds.
  if (hooks.background) guarded_poll("background", [] { hooks.background(); });
  progress_code = 0;
}

void shutdown_suite() {
  log_message("Shutting down");
  if (pid_file_written) ::unlink(paths.pid_file.c_str());
  control_remove();
  log_message("Shutting down dialler");
  dialler_shutdown();
  dns_shutdown();
  log_message("Shutting down sockets");
  net_close_all();
  log_message("Shutting down filecache");
  filecache_shutdown();
  log_message("Shutting down logger");
  log_flush_all();
}

// ---- start-up ---------------------------------------------------------------

// An admin.email without "@" gets the mail domain (the first of
// mail.domains, else server.name): it goes into every greeting.
void complete_admin_email() {
  if (!config.admin_email || config.admin_email->find('@') != std::string::npos) return;
  std::string domain = text_of(config.mail_domains);
  domain = domain.substr(0, domain.find_first_of(", \t"));
  if (domain.empty()) domain = text_of(config.server_name);
  if (!domain.empty()) *config.admin_email += "@" + domain;
}

// The pid file is written under a temporary name and renamed into place, so
// whoever sees it sees the whole number. When it cannot be written the suite
// runs without one.
void write_pid_file() {
  make_parent_dirs(paths.pid_file);
  pid_file_written = file_write_atomic(paths.pid_file, std::to_string(getpid()), false, 0644) == 0;
}

int start_and_run() {
  server_now = std::time(nullptr);
  refresh_crash_stamp();
  set_signal_handlers();
  if (file_is_regular(paths.pid_file)) {
    std::printf("Velmor server is already running, or has died messily - cannot start new server\n");
    return 1;
  }
  std::printf("Velmor Server Suite starting...\n");

  std::printf("Loading config file\n");
  // Relative paths of the configuration are relative to the installation.
  if (chdir(paths.root.c_str()) != 0) {
    // The configuration load below reports the missing folder.
  }
  if (int rc = config_load()) {
    std::printf("Config load faile d\n");
    return rc;
  }
  std::printf("loaded config\n");
  log_mask = static_cast<std::uint32_t>(config.store_state);
  if (std::string error = privileges_assume(text_of(config.server_user)); !error.empty()) {
    std::printf("%s\n", error.c_str());
    return 1;
  }

  std::printf("initing filecache\n");
  if (int rc = filecache_init()) {
    std::printf("filecache init failed\n");
    return rc;
  }
  std::printf("Initing logger\n");
  progress_code = 160000;
  if (int rc = log_init()) {
    std::printf("logger init failed\n");
    return rc;
  }
  std::printf("logging on...\n");
  log_message("++++++++++++++++++++++++++++++ Starting ++++++++++++++++++++++++++++++++");
  log_message("Logger started");
  log_message("Config loaded");
  log_message("File cache initialised");
  log_message("Setting signal handlers");

  log_message("Loading MIME mapping table");
  mime_map_load();
  for (const ConfigText* dir : {&config.mail_dir_incoming, &config.mail_dir_outgoing, &config.news_dir_incoming,
                                &config.news_dir_outgoing, &config.proxy_cache_dir})
    if (!text_of(*dir).empty()) make_path(text_of(*dir));

  // From here on a failing step writes out what the logger holds first.
  auto fail = [](const char* console, int rc) {
    if (console) std::printf("%s\n", console);
    log_flush_all();
    return rc;
  };

  log_message("Initialising dialler");
  if (dialler_init() != 0) return fail(nullptr, 1);
  log_message("Loading modem dial-in entries");
  dialin_load();
  log_message("Loading scheduler task entries");
  if (int rc = schedule_load(); rc != 0) return fail("Scheduler init failed", rc);
  // "Loading user database", "Loading user group options"; users_init says what failed.
  if (int rc = users_init()) return fail(nullptr, rc);
  dns_register();  // its sockets open once the loop is up
  log_message("Initialising mail system");
  mail_init();
  complete_admin_email();
  // The services, in the order their listeners open.
  imap_register();
  pop_register();
  smtp_register();
  log_message("Starting listening sockets");
  // Without its control channel the suite could not be steered, and a
  // squatter on the path would get what local tools send: no start.
  if (net_start() != 0 || control_open() != 0) {
    log_message("Socket initialisation failed - see logs for more info");
    net_close_all();
    control_remove();
    return fail("Socket initialisation failed - see logs for more info", 1);
  }
  dns_start();
  if (std::string error = privileges_drop(); !error.empty()) {
    log_message(error);
    dns_shutdown();
    net_close_all();
    control_remove();
    return fail(error.c_str(), 1);
  }
  if (!text_of(config.server_user).empty()) log_message("Running as user ", text_of(config.server_user));

  log_message("Suite started: ", kVersion);
  progress_code = 0;
  write_pid_file();

  poll();
  shutdown_suite();
  return 0;
}

}  // namespace
}  // namespace velmor

int main(int argc, char** argv) {
  using namespace velmor;
  // Console lines appear in order, also when standard output is a file and
  // the crash handler writes to it directly.
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  Options options;
  int users_command = users_command_options(argc, argv);  // --adduser, --passwd, --deluser
  if (users_command == 2) return 2;
  if (int rc = parse_command_line(argc, argv, options); rc >= 0) return rc;
  if (users_command == 1) {
    // As root on an installation that runs as server.user, the user file
    // and the homes made stay that user's.
    if (geteuid() == 0 && file_is_regular(paths.master()) && config_load() == 0) {
      std::string error = privileges_assume(text_of(config.server_user));
      if (error.empty()) error = privileges_drop();
      if (!error.empty()) {
        std::printf("%s\n", error.c_str());
        return 1;
      }
    }
    return users_command_run();
  }
  if (options.init) return init_installation(options);
  return start_and_run();
}
