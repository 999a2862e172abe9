// velmorctl: sends one command to a running suite over its control channel
// and prints the replies.
//
//   velmorctl [--root DIR] [--control PATH] [--raw] COMMAND...
//
// The words of COMMAND are joined with blanks and checked against the
// commands the suite knows (`velmorctl help`); an unknown one is refused
// here, since the suite itself ignores what it does not know. The reply
// socket is bound to a fresh abstract address chosen by the kernel, so
// nothing is left behind in the file system. A socket owned by anyone but
// root, the suite's user (server.user in DIR/config/master) or the caller is
// refused: a password change must not reach a squatter. "status" is printed
// in words; --raw prints the suite's reply as it came. Exit status: 0 done;
// 1 the suite did not answer a command that has a reply (or could not be
// reached, or the socket was refused); 2 usage or an unknown command; 3 a
// password change was refused. "lookup NAME" is answered when the lookup
// ends, which may take a while: velmorctl waits as long as the suite still
// answers "test" in between.
#include <poll.h>
#include <pwd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <string>
#include <string_view>
#include <vector>

#include "core/globals.h"

namespace {

constexpr int kReplyWaitMs = 3000;
constexpr int kLookupWaitMs = 600000;  // far beyond the slowest lookup a configuration allows
constexpr std::size_t kMaxCommand = 250;  // the suite ignores longer requests

// What a command gets back from the suite.
enum class Reply { none, one, listing, password, lookup, status, help };

struct Command {
  const char* words;  // compared without regard to case
  const char* args;   // what follows the words ("" = nothing)
  Reply reply;
  const char* help;
};

constexpr Command kCommands[] = {
    {"status", "", Reply::status, "how the suite is: mail queues, news, the link, connections"},
    {"test", "", Reply::one, "whether the suite answers (\"test:\" and its clock)"},
    {"listmq", "", Reply::listing, "the outgoing mail queue: time, size, sender, recipients"},
    {"listnq", "", Reply::listing, "the outgoing news queue"},
    {"incoming", "", Reply::one, "the incoming mail queue (\"iq:\" waiting, \"retry:\" of them for later)"},
    {"lookup", "NAME", Reply::lookup, "resolve NAME with the suite's resolver and wait for the answer"},
    {"reload config", "", Reply::none, "re-read the master configuration (ports apply at the next start)"},
    {"reload users", "", Reply::none, "re-read the user file"},
    {"reload groups", "", Reply::none, "re-read the group options"},
    {"change pass", "USER OLD NEW", Reply::password, "change a password (exit status 3 when refused)"},
    {"log", "FACILITY", Reply::none, "write FACILITY's lines to the main log (facilities below)"},
    {"nolog", "FACILITY", Reply::none, "stop writing FACILITY's lines to the main log"},
    {"clear mqcng", "", Reply::none, "clear the \"mail queue changed\" mark of status"},
    {"clear nqcng", "", Reply::none, "clear the \"news queue changed\" mark of status"},
    {"maildebatch", "", Reply::none, "deliver the incoming mail queue now"},
    {"mailrescan", "", Reply::none, "read the incoming and outgoing queue folders again"},
    {"mailtransfer", "", Reply::none, "bring the link up, fetch and send mail, drop the link"},
    {"connect", "", Reply::none, "dial: bring the link up"},
    {"disconnect", "", Reply::none, "hang the link up"},
    {"smtpkick", "", Reply::none, "send the outgoing mail queue now"},
    {"popkick", "", Reply::none, "fetch mail from the providers' POP3 mailboxes now"},
    {"newskick", "", Reply::none, "fetch news now"},
    {"newsdebatch", "", Reply::none, "file the incoming news now"},
    {"help", "", Reply::help, "this list"},
};

constexpr const char* kFacilities[] = {"house", "smtp", "pop", "imap", "maildebatch", "newsfetch", "newsserver",
                                       "newsdebatch", "web", "proxy", "dns", "fcache", "schedule", "dialler",
                                       "utils"};

char lower(char c) { return c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : c; }

bool iequals_prefix(std::string_view text, std::string_view prefix, bool whole) {
  if (text.size() < prefix.size() || (whole && text.size() != prefix.size())) return false;
  for (std::size_t i = 0; i < prefix.size(); ++i)
    if (lower(text[i]) != lower(prefix[i])) return false;
  return true;
}

std::vector<std::string_view> words_of(std::string_view text) {
  std::vector<std::string_view> out;
  std::size_t i = 0;
  while (i < text.size()) {
    std::size_t start = text.find_first_not_of(' ', i);
    if (start == std::string_view::npos) break;
    std::size_t end = text.find(' ', start);
    out.push_back(text.substr(start, end == std::string_view::npos ? std::string_view::npos : end - start));
    i = end == std::string_view::npos ? text.size() : end;
  }
  return out;
}

// The command `text` is, or nullptr. `why` says what is wrong with one
// that is known but badly given.
const Command* find_command(std::string_view text, std::string& why) {
  for (const Command& c : kCommands) {
    std::string_view words = c.words;
    if (!*c.args) {
      if (iequals_prefix(text, words, true)) return &c;
      continue;
    }
    if (!iequals_prefix(text, words, false) || (text.size() > words.size() && text[words.size()] != ' ')) continue;
    std::vector<std::string_view> given = words_of(text.substr(words.size()));
    std::size_t wanted = words_of(c.args).size();
    if (given.size() != wanted) {
      why = std::string(c.words) + " needs " + c.args;
      return nullptr;
    }
    if (words == "log" || words == "nolog") {
      // The suite compares the word by each facility's length, as here.
      for (const char* f : kFacilities)
        if (iequals_prefix(given[0], f, false)) return &c;
      why = "no log facility '" + std::string(given[0]) + "'";
      return nullptr;
    }
    return &c;
  }
  return nullptr;
}

void print_help(FILE* out) {
  std::fprintf(out,
               "usage: velmorctl [--root DIR] [--control PATH] [--raw] COMMAND...\n"
               "       velmorctl --version | --help\n"
               "  --root DIR      the installation (default /usr/local/velmor); its run/control is the socket\n"
               "  --control PATH  the control socket, when it is elsewhere\n"
               "  --raw           print the suite's replies as they come (status: is/mq/nq/wf/pf)\n"
               "\n"
               "Commands:\n");
  for (const Command& c : kCommands) {
    std::string name = std::string(c.words) + (*c.args ? std::string(" ") + c.args : std::string());
    std::fprintf(out, "  %-26s %s\n", name.c_str(), c.help);
  }
  std::fprintf(out, "Log facilities:");
  for (const char* f : kFacilities) std::fprintf(out, " %s", f);
  std::fprintf(out, "\n");
}

// "1 message", "2 messages".
std::string count_of(long n, const char* thing) {
  return std::to_string(n) + " " + thing + (n == 1 ? "" : "s");
}

// The fields of a reply such as "is:5\nmq:0\n".
std::map<std::string, long> fields_of(std::string_view reply) {
  std::map<std::string, long> out;
  std::size_t pos = 0;
  while (pos < reply.size()) {
    std::size_t end = reply.find('\n', pos);
    std::string_view line = reply.substr(pos, end == std::string_view::npos ? std::string_view::npos : end - pos);
    pos = end == std::string_view::npos ? reply.size() : end + 1;
    std::size_t colon = line.find(':');
    if (colon == std::string_view::npos) continue;
    out[std::string(line.substr(0, colon))] = std::strtol(std::string(line.substr(colon + 1)).c_str(), nullptr, 10);
  }
  return out;
}

// The status reply (and the incoming queue's, when it came) in words.
void print_status(std::string_view status, std::string_view incoming) {
  std::map<std::string, long> s = fields_of(status), in = fields_of(incoming);
  const long bits = s["is"];
  auto line = [](const char* label, const std::string& text) { std::printf("%-15s %s\n", label, text.c_str()); };
  if (in.count("iq")) {
    std::string text = count_of(in["iq"], "message") + " waiting to be delivered";
    if (in["retry"] > 0) text += " (" + std::to_string(in["retry"]) + " to be tried again later)";
    line("Incoming mail:", text);
  } else {
    line("Incoming mail:", "unknown (the suite did not say)");
  }
  line("Outgoing mail:", count_of(s["mq"], "message") + " waiting to be sent");
  line("News:", count_of(s["nq"], "article") + " waiting to be sent");
  line("Link:", bits & 0x10000 ? "up" : "down");
  line("Dialler:", bits & 0x8000 ? "dialling or on line" : "idle");
  line("Connections:", "web server " + std::to_string(s["wf"]) + ", proxy " + std::to_string(s["pf"]));
  std::string running;
  for (auto [bit, what] : {std::pair{0x100L, "SMTP client"}, {0x400L, "POP3 client"}, {0x1000L, "news fetch"}})
    if (bits & bit) running += (running.empty() ? "" : ", ") + std::string(what);
  if (!running.empty()) line("Running:", running);
  std::string events;
  for (auto [bit, what] : {std::pair{0x4L, "mail queue changed"}, {0x20000L, "news queue changed"},
                           {0x10L, "POP3 fetch ended"}, {0x20L, "SMTP send run ended"}, {0x40L, "news fetch ended"},
                           {0x80L, "link came or went"}, {0x8L, "proxy activity"}})
    if (bits & bit) events += (events.empty() ? "" : ", ") + std::string(what);
  if (!events.empty()) line("Since cleared:", events);
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

int usage() {
  std::fprintf(stderr,
               "usage: velmorctl [--root DIR] [--control PATH] [--raw] COMMAND...\n"
               "  e.g. velmorctl --root /srv/velmor status; velmorctl help lists the commands\n");
  return 2;
}

}  // namespace

int main(int argc, char** argv) {
  std::string root = "/usr/local/velmor", control;
  bool raw = false;
  int i = 1;
  for (; i < argc && argv[i][0] == '-'; ++i) {
    std::string_view opt = argv[i];
    if (opt == "--help" || opt == "-h") {
      print_help(stdout);
      return 0;
    }
    if (opt == "--version") {
      std::printf("velmorctl %s\n", velmor::kVersion);
      return 0;
    }
    if (opt == "--raw") {
      raw = true;
      continue;
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
  std::string why;
  const Command* known = find_command(command, why);
  if (!known) {
    if (why.empty()) {
      std::fprintf(stderr, "velmorctl: unknown command '%s' (velmorctl help lists the commands)\n",
                   command.c_str());
    } else {
      std::fprintf(stderr, "velmorctl: %s (velmorctl help lists the commands)\n", why.c_str());
    }
    return 2;
  }
  if (known->reply == Reply::help) {
    print_help(stdout);
    return 0;
  }
  if (command.size() > kMaxCommand) {
    std::fprintf(stderr, "velmorctl: a command has %zu characters at most\n", kMaxCommand);
    return 2;
  }

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
  auto send = [&](std::string_view text) {
    return sendto(fd, text.data(), text.size(), 0, reinterpret_cast<sockaddr*>(&to), sizeof to) ==
           static_cast<ssize_t>(text.size());
  };
  if (!send(command)) {
    std::fprintf(stderr, "velmorctl: cannot reach the suite at %s: %s\n", control.c_str(), std::strerror(errno));
    close(fd);
    return 1;
  }
  // Status in words also tells the incoming queue, which is a question of its own.
  const bool words = known->reply == Reply::status && !raw;
  if (words) send("incoming");
  if (known->reply == Reply::none) {
    close(fd);
    return 0;
  }
  int status = 0;
  bool alive_asked = false;  // a lookup's wait: "test" sent, its answer not yet seen
  std::string status_reply, incoming_reply;
  for (int waited = 0;;) {
    pollfd p{fd, POLLIN, 0};
    if (poll(&p, 1, kReplyWaitMs) <= 0) {
      waited += kReplyWaitMs;
      if (known->reply == Reply::lookup && !alive_asked && waited < kLookupWaitMs && send("test")) {
        alive_asked = true;  // still running? then the lookup is still going
        continue;
      }
      if (words && !status_reply.empty()) break;  // a suite that does not know "incoming"
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
    if (known->reply == Reply::lookup && !reply.starts_with("lookup:")) {
      alive_asked = false;  // the answer to "test"
      continue;
    }
    if (words) {
      (reply.starts_with("iq:") ? incoming_reply : status_reply) = std::string(reply);
      if (!status_reply.empty() && !incoming_reply.empty()) break;
      continue;
    }
    std::fwrite(reply.data(), 1, reply.size(), stdout);
    if (!reply.empty() && reply.back() != '\n') std::fputc('\n', stdout);
    if (known->reply == Reply::password && reply != "2") status = 3;
    if (known->reply != Reply::listing || reply.starts_with("end mq") || reply.starts_with("end nq")) break;
  }
  if (words && !status_reply.empty()) print_status(status_reply, incoming_reply);
  std::fflush(stdout);
  close(fd);
  return status;
}
