// velmorctl: sends one command to a running suite over its control channel
// and prints the replies.
//
//   velmorctl [--root DIR] [--control PATH] COMMAND...
//
// The words of COMMAND are joined with blanks. The reply socket is bound to
// a fresh abstract address chosen by the kernel, so nothing is left behind
// in the file system. A socket owned by anyone but root, the suite's user
// (server.user in DIR/config/master) or the caller is refused: a password
// change must not reach a squatter. Exit status: 0 done; 1 the suite did not
// answer a command that has a reply (or could not be reached, or the socket
// was refused); 2 usage; 3 a password change was refused. "lookup NAME" is
// answered when the lookup ends, which may take a while: velmorctl waits as
// long as the suite still answers "test" in between.
#include <poll.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>
#include <string_view>

namespace {

constexpr int kReplyWaitMs = 3000;
constexpr int kLookupWaitMs = 600000;  // far beyond the slowest lookup a configuration allows
constexpr std::size_t kMaxCommand = 250;  // the suite ignores longer requests

bool iequals_prefix(std::string_view text, std::string_view prefix, bool whole) {
  if (text.size() < prefix.size() || (whole && text.size() != prefix.size())) return false;
  for (std::size_t i = 0; i < prefix.size(); ++i) {
    char a = text[i], b = prefix[i];
    if (a >= 'A' && a <= 'Z') a = static_cast<char>(a - 'A' + 'a');
    if (a != b) return false;
  }
  return true;
}

int usage() {
  std::fprintf(stderr,
               "usage: velmorctl [--root DIR] [--control PATH] COMMAND...\n"
               "  e.g. velmorctl --root /srv/velmor status\n");
  return 2;
}

// The user the suite runs as: server.user of the installation's master
// file, when it is set and readable. -1 when unknown.
long suite_uid(const std::string& root) {
  std::ifstream master(root + "/config/master");
  std::string line;
  while (std::getline(master, line)) {
    if (!iequals_prefix(line, "%server.user:", false)) continue;
    std::string name = line.substr(13);
    name.erase(0, name.find_first_not_of(" \t"));
    name.erase(name.find_last_not_of(" \t\r") + 1);
    if (name.empty()) return -1;
    const passwd* pw = getpwnam(name.c_str());
    return pw ? static_cast<long>(pw->pw_uid) : -1;
  }
  return -1;
}

// Whether the socket at `path` may be trusted with a command.
bool trusted_socket(const std::string& path, const std::string& root) {
  struct stat st {};
  if (lstat(path.c_str(), &st) != 0) return true;  // nobody there: sending fails and says so
  if (!S_ISSOCK(st.st_mode)) {
    std::fprintf(stderr, "velmorctl: %s is not a socket\n", path.c_str());
    return false;
  }
  if (st.st_uid == 0 || st.st_uid == getuid() || static_cast<long>(st.st_uid) == suite_uid(root)) return true;
  std::fprintf(stderr, "velmorctl: refusing %s: its owner (uid %ld) is neither root nor the suite's user\n",
               path.c_str(), static_cast<long>(st.st_uid));
  return false;
}

}  // namespace

int main(int argc, char** argv) {
  std::string root = "/usr/local/velmor", control;
  int i = 1;
  for (; i < argc && argv[i][0] == '-'; ++i) {
    std::string_view opt = argv[i];
    if (opt == "--help" || opt == "-h") {
      usage();
      return 0;
    }
    if (i + 1 >= argc) return usage();
    if (opt == "--root") root = argv[++i];
    else if (opt == "--control") control = argv[++i];
    else return usage();
  }
  if (control.empty()) control = root + "/run/control";
  std::string command;
  for (; i < argc; ++i) {
    if (!command.empty()) command += ' ';
    command += argv[i];
  }
  if (command.empty()) return usage();
  if (command.size() > kMaxCommand) {
    std::fprintf(stderr, "velmorctl: a command has %zu characters at most\n", kMaxCommand);
    return 2;
  }

  const bool listing = iequals_prefix(command, "listmq", true) || iequals_prefix(command, "listnq", true);
  const bool password = iequals_prefix(command, "change pass", false);
  const bool lookup = iequals_prefix(command, "lookup ", false);
  const bool answered = listing || password || lookup || iequals_prefix(command, "test", true) ||
                        iequals_prefix(command, "status", true);

  sockaddr_un to{};
  to.sun_family = AF_UNIX;
  if (control.size() >= sizeof to.sun_path) {
    std::fprintf(stderr, "velmorctl: control socket path too long: %s\n", control.c_str());
    return 1;
  }
  std::memcpy(to.sun_path, control.data(), control.size());
  if (!trusted_socket(control, root)) return 1;

  int fd = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un self{};
  self.sun_family = AF_UNIX;
  // Binding just the family picks a unique abstract address.
  if (fd < 0 || bind(fd, reinterpret_cast<sockaddr*>(&self), sizeof(sa_family_t)) != 0) {
    std::fprintf(stderr, "velmorctl: cannot make a reply socket: %s\n", std::strerror(errno));
    return 1;
  }
  if (sendto(fd, command.data(), command.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to) < 0) {
    std::fprintf(stderr, "velmorctl: cannot reach the suite at %s: %s\n", control.c_str(),
                 std::strerror(errno));
    close(fd);
    return 1;
  }
  if (!answered) {
    close(fd);
    return 0;
  }
  int status = 0;
  bool alive_asked = false;  // a lookup's wait: "test" sent, its answer not yet seen
  for (int waited = 0;;) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, kReplyWaitMs) <= 0) {
      waited += kReplyWaitMs;
      if (lookup && !alive_asked && waited < kLookupWaitMs &&
          sendto(fd, "test", 4, 0, reinterpret_cast<sockaddr*>(&to), sizeof to) == 4) {
        alive_asked = true;  // still running? then the lookup is still going
        continue;
      }
      std::fprintf(stderr, "velmorctl: no answer from the suite at %s\n", control.c_str());
      status = 1;
      break;
    }
    char buf[65536];
    ssize_t n = recv(fd, buf, sizeof buf, 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      status = 1;
      break;
    }
    std::string_view reply(buf, static_cast<std::size_t>(n));
    if (lookup && !reply.starts_with("lookup:")) {
      alive_asked = false;  // the answer to "test"
      continue;
    }
    std::fwrite(reply.data(), 1, reply.size(), stdout);
    if (!reply.empty() && reply.back() != '\n') std::fputc('\n', stdout);
    if (password && reply != "2") status = 3;
    if (!listing || reply.starts_with("end mq") || reply.starts_with("end nq")) break;
  }
  std::fflush(stdout);
  close(fd);
  return status;
}
