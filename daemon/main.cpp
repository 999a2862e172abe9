// velmor: the daemon. Start-up, the main loop and shutdown.
//
// This is the one file that knows every subsystem: start-up brings them up in
// order, the main loop runs their polls every half second, and shutdown takes
// them down in order. Each subsystem wires itself in at the marked places.
#include <arpa/inet.h>
#include <fcntl.h>
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <exception>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "core/background.h"
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
#include "core/pidfile.h"
#include "core/strfmt.h"
#include "core/tls.h"
#include "dialler/dialin.h"
#include "dialler/dialler.h"
#include "dns/service.h"
#include "mail/imap_server.h"
#include "mail/pop_client.h"
#include "mail/pop_server.h"
#include "mail/queue.h"
#include "mail/smtp_client.h"
#include "mail/smtp_server.h"
#include "users/admin.h"

namespace velmor {
namespace {

// ---- command line -----------------------------------------------------------

// How the console names each service, and the ports the default
// installation gives it (unprivileged, and with --standard-ports). A service
// is listed, and switched on by --init, only once it is built:
// register_services() below says which.
struct ServiceName {
  std::string_view name;  // the service's own name
  const char* title;
  std::string_view port_placeholder;     // in the default configuration
  std::string_view enabled_placeholder;  // "yes" when built, else "no"
  int port, standard_port;
};
constexpr ServiceName kServiceNames[] = {
    {"smtp", "SMTP", "@SMTP_PORT@", "@SMTP_ENABLED@", 2525, 25},
    {"pop", "POP3", "@POP_PORT@", "@POP_ENABLED@", 1110, 110},
    {"imap", "IMAP", "@IMAP_PORT@", "@IMAP_ENABLED@", 1143, 143},
    {"nntp", "NNTP", "@NNTP_PORT@", "@NNTP_ENABLED@", 1119, 119},
    {"web", "web server", "@WEB_PORT@", "@WEB_ENABLED@", 8000, 80},
    {"smtps", "SMTPS", "@SMTPS_PORT@", "@SMTPS_ENABLED@", 1465, 465},
    {"submission", "Submission", "@SUBMISSION_PORT@", "@SUBMISSION_ENABLED@", 1587, 587},
    {"pops", "POP3S", "@POPS_PORT@", "@POPS_ENABLED@", 1995, 995},
    {"imaps", "IMAPS", "@IMAPS_PORT@", "@IMAPS_ENABLED@", 1993, 993},
};

const ServiceName* service_name(std::string_view name) {
  for (const auto& s : kServiceNames)
    if (s.name == name) return &s;
  return nullptr;
}

std::string service_title(std::string_view name) {
  if (const ServiceName* s = service_name(name)) return s->title;
  std::string title(name);
  for (char& c : title) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return title;
}

// The services this build runs, in the order their listeners open. A new
// service adds its register call here; --help, --init and the start-up
// lines then name it.
void register_services() {
  imap_register();
  pop_register();
  smtp_register();
  pop_client_register();  // outward only: no listener
  smtp_client_register();
  // The TLS listeners share the sessions of the plain services above.
  tls_register_services();
}

// "SMTP 2525, POP3 1110": the built services with their default ports.
std::string built_ports(bool standard) {
  std::string out;
  for (const ServiceDescriptor* d : service_list()) {
    const ServiceName* s = d->port ? service_name(d->name) : nullptr;
    if (!s) continue;
    if (!out.empty()) out += ", ";
    out += strprintf("%s %d", s->title, standard ? s->standard_port : s->port);
  }
  return out;
}

std::string usage() {
  return "usage: velmor [--root DIR] [--pid-file PATH] [--control PATH] [--bind ADDR]\n"
         "              [--init [--standard-ports] [--user NAME] [--no-demo]] [--help] [--version]\n"
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
         "                    files that exist are left alone. The services this build runs\n"
         "                    listen on unprivileged ports (" +
         built_ports(false) +
         ")\n"
         "  --standard-ports  with --init: " +
         built_ports(true) +
         "\n"
         "  --user NAME       with --init: server.user, the user the suite runs as once its\n"
         "                    listeners are bound when started as root\n"
         "  --no-demo         with --init: no demo user (otherwise a new installation gets\n"
         "                    the user demo with a random password, kept in DIR/demo-login)\n"
         "  --adduser NAME    add a user (home DIR/home/NAME, group 0 unless given); without\n"
         "                    --password the password is read from standard input\n"
         "  --passwd NAME     set a user's password; --deluser NAME removes a user. A running\n"
         "                    suite is told to reload the user file\n"
         "  --help            this text\n"
         "  --version         the version\n"
         "\n"
         "The suite stays in the foreground and prints each service it listens on; stop it\n"
         "with SIGTERM or Ctrl-C. velmorctl --root DIR help lists what a running suite is told.\n";
}

struct Options {
  bool init = false;
  bool standard_ports = false;
  bool demo = true;  // --init without --no-demo
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
      register_services();
      std::fputs(usage().c_str(), stdout);
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
    } else if (arg == "--no-demo") {
      options.demo = false;
    } else if (arg == "--user") {
      ok = value(options.user);
      if (ok && options.user.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789._-") !=
                    std::string::npos) {
        std::fprintf(stderr, "velmor: --user needs a user name, not '%s'\n", options.user.c_str());
        return 2;
      }
    } else {
      std::fprintf(stderr, "velmor: unknown option '%s' (velmor --help lists them)\n", argv[i]);
      return 2;
    }
    if (!ok) {
      std::fprintf(stderr, "velmor: %s needs a value (velmor --help lists the options)\n", argv[i]);
      return 2;
    }
  }
  if ((options.standard_ports || !options.user.empty() || !options.demo) && !options.init) {
    std::fprintf(stderr, "velmor: --standard-ports, --user and --no-demo go with --init\n");
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

// A self-signed certificate for this host where the master file's tls.cert
// and tls.key name files that do not exist yet; handed to --user when
// running as root, so the suite can read its key once it runs as that user.
int make_certificate(const Options& options) {
  if (config_load_file(paths.master()) != 0) return 0;  // said so already
  auto where = [](const ConfigText& key) {
    const std::string& path = text_of(key);
    return path.empty() || path[0] == '/' ? path : path_join(paths.root, path);
  };
  const std::string cert = where(config.tls_cert), key = where(config.tls_key);
  if (cert.empty() || key.empty() || file_size(cert) >= 0 || file_size(key) >= 0) return 0;
  int uid = -1, gid = -1;
  if (!options.user.empty() && geteuid() == 0) {
    if (const passwd* pw = getpwnam(options.user.c_str())) {
      uid = static_cast<int>(pw->pw_uid);
      gid = static_cast<int>(pw->pw_gid);
    } else {
      std::printf("No user %s yet: the TLS key stays root's; hand it over before starting\n", options.user.c_str());
    }
  }
  ::mkdir(std::string(path_dir(key)).c_str(), 0750);
  if (std::string error = tls_make_self_signed(cert, key, host_name(), uid, gid); !error.empty()) {
    std::printf("Cannot make the TLS certificate: %s\n", error.c_str());
    return 1;
  }
  std::printf("Made a self-signed TLS certificate for %s: %s\n", host_name().c_str(), cert.c_str());
  return 0;
}

// Writes every embedded default file that does not exist yet, with the host
// name and the ports filled in, and makes the folders the suite uses.
int init_installation(const Options& options) {
  const bool standard = options.standard_ports;
  std::vector<std::pair<std::string_view, std::string>> values = {
      {"@HOSTNAME@", host_name()},
      {"@SERVER_USER@", options.user},
  };
  register_services();
  for (const auto& s : kServiceNames) {
    values.emplace_back(s.port_placeholder, std::to_string(standard ? s.standard_port : s.port));
    bool built = false;
    for (const ServiceDescriptor* d : service_list()) built = built || d->name == s.name;
    values.emplace_back(s.enabled_placeholder, built ? "yes" : "no");
  }
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
  if (make_certificate(options) != 0) return 1;
  // Later subsystems add their own first-run steps here (sample users, ...).
  if (options.demo && users_make_demo() != 0) return 1;
  std::printf("Velmor installation in %s: %d files written, %d left as they were\n", paths.root.c_str(), written,
              kept);
  // What it will run: the built services switched on in its master file.
  config_reset();
  config_load_file(paths.master());
  register_services();
  std::string services;
  for (const ServiceDescriptor* d : service_list()) {
    if (!d->port || (d->enabled && !*d->enabled)) continue;
    if (!services.empty()) services += ", ";
    services += strprintf("%s port %d", service_title(d->name).c_str(), *d->port);
  }
  std::printf("Services: %s\n", services.empty() ? "none switched on" : services.c_str());
  std::printf("Start it with: velmor --root %s\n", paths.root.c_str());
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

// Held from the first step of start-up to the last of shutdown.
PidFile pid_file;

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
    if (!quit_flag) guarded_poll("background", [&busy] { busy = background_round(); });
  }
  // Told that the suite stops, background work settles what it holds.
  guarded_poll("background", [] { background_settle(); });
  progress_code = 0;
}

void shutdown_suite() {
  log_message("Shutting down");
  pid_file.remove();
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

constexpr const char* kRefusal = "Velmor server is already running, or has died messily - cannot start new server";

// Says what became of each service's port; the last word on a port that
// could not be taken is the log's.
void report_listeners(const std::vector<ListenReport>& report) {
  for (const ListenReport& r : report) {
    std::string title = service_title(r.service);
    std::string line;
    if (!r.enabled) {
      line = "Not listening for " + title + ": switched off in the master configuration";
    } else if (r.error.empty()) {
      line = strprintf("Listening for %s on %s:%d", title.c_str(), r.address.c_str(), r.port);
    } else {
      line = strprintf("Cannot listen for %s on %s:%d: %s", title.c_str(), r.address.c_str(), r.port,
                       r.error.c_str());
    }
    std::printf("%s\n", line.c_str());
    log_message(line);
  }
}

// Writes the pid file (see core/pidfile.h). False when another instance
// published its own since start-up began: this one must not run.
bool publish_pid_file() {
  make_parent_dirs(paths.pid_file);
  switch (pid_file.publish(getpid())) {
    case PidFile::Claim::running:
      return false;
    case PidFile::Claim::failed:
      log_message("The pid file cannot be written, running without one: ", pid_file.error());
      break;
    case PidFile::Claim::stale: {
      std::string line = "Replaced the pid file of a suite that is no longer running";
      if (!pid_file.stale_pid().empty()) line += " (process " + pid_file.stale_pid() + ")";
      std::printf("%s\n", line.c_str());
      log_message(line + ": ", pid_file.path());
      break;
    }
    case PidFile::Claim::free:
      break;
  }
  return true;
}

int start_and_run() {
  server_now = std::time(nullptr);
  refresh_crash_stamp();
  set_signal_handlers();
  // A file whose lock nobody holds was left by a suite that died: it is
  // kept locked (so a second instance stops here) and replaced once the
  // listeners are open.
  switch (pid_file.claim(paths.pid_file)) {
    case PidFile::Claim::running:
      std::printf("%s\n", kRefusal);
      return 1;
    case PidFile::Claim::failed:
      std::printf("%s\n(the pid file %s cannot be tested: %s)\n", kRefusal, paths.pid_file.c_str(),
                  pid_file.error().c_str());
      return 1;
    case PidFile::Claim::free:
    case PidFile::Claim::stale:
      break;
  }
  std::printf("Velmor Server Suite starting...\n");

  std::printf("Loading config file\n");
  // Relative paths of the configuration are relative to the installation.
  if (chdir(paths.root.c_str()) != 0) {
    // The configuration load below reports the missing folder.
  }
  if (int rc = config_load()) {
    std::printf("Config load faile d\n");
    struct stat st {};
    if (::stat(paths.master().c_str(), &st) != 0 && errno == ENOENT)
      std::printf("No master configuration in %s: make a default installation with: velmor --root %s --init\n",
                  paths.root.c_str(), paths.root.c_str());
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
  register_services();
  tls_load();  // "TLS certificate loaded: ..." or why TLS is off
  log_message("Starting listening sockets");
  std::vector<ListenReport> listening;
  int listen_rc = net_start(&listening);
  report_listeners(listening);
  // Without its control channel the suite could not be steered, and a
  // squatter on the path would get what local tools send: no start.
  if (listen_rc != 0 || control_open() != 0) {
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

  std::printf("Control channel: %s\n", paths.control.c_str());

  log_message("Suite started: ", kVersion);
  progress_code = 0;
  if (!publish_pid_file()) {
    log_message("Another suite started meanwhile: stopping");
    dns_shutdown();
    net_close_all();
    control_remove();
    return fail(kRefusal, 1);
  }
  std::printf("Velmor %s is running as process %ld; velmorctl --root %s status tells how it is\n", kVersion,
              static_cast<long>(getpid()), paths.root.c_str());

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
