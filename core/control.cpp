// The control channel: a local datagram socket. Each request is one datagram
// of command text; replies go back to the sender's own bound address. Replies
// never hold the loop up: a short reply that finds the reader's queue full is
// lost, and a queue listing, longer than any reader's queue, goes out from a
// socket of its own as fast as the reader takes it.
#include "core/control.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <deque>
#include <list>
#include <vector>

#include "core/commands.h"
#include "core/config.h"
#include "core/fileio.h"
#include "core/globals.h"
#include "core/hooks.h"
#include "core/log.h"
#include "core/network.h"
#include "core/strfmt.h"
#include "core/tls.h"
#include "core/util.h"

namespace velmor {

namespace {

constexpr std::size_t kMaxRequest = 250;
constexpr std::size_t kMaxWord = 62;

struct ControlSocket {
  dev_t dev = 0;  // the socket file this process made
  ino_t ino = 0;
  bool made = false;
  int fd = -1;  // the socket now open, for replies sent after the request's pass
};
ControlSocket& control() {
  static ControlSocket c;
  return c;
}

bool make_address(const std::string& path, sockaddr_un& a, socklen_t& len) {
  a = sockaddr_un{};
  a.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof a.sun_path) return false;
  std::memcpy(a.sun_path, path.data(), path.size());
  len = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + path.size() + 1);
  return true;
}

// A socket file left by a crashed suite answers nobody; one that a running
// suite still serves is left alone (bind then fails and says so).
void remove_stale_socket(const std::string& path) {
  struct stat st{};
  if (lstat(path.c_str(), &st) != 0 || !S_ISSOCK(st.st_mode)) return;
  sockaddr_un a;
  socklen_t len;
  if (!make_address(path, a, len)) return;
  int probe = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  if (probe < 0) return;
  bool alive = ::connect(probe, reinterpret_cast<sockaddr*>(&a), len) == 0;
  int error = errno;
  ::close(probe);
  if (!alive && error == ECONNREFUSED) unlink(path.c_str());
}

std::time_t last_send_failure_log = -1;

// Sends one reply datagram without waiting. A failure is logged, at most
// once a second, so a client that never reads cannot flood the log.
void send_reply(int fd, const sockaddr_un& to, socklen_t to_len, std::string_view text,
                const char* failure_text) {
  if (fd < 0 || to_len <= sizeof(sa_family_t)) return;  // an unbound sender cannot be answered
  if (::sendto(fd, text.data(), text.size(), MSG_DONTWAIT | MSG_NOSIGNAL,
               reinterpret_cast<const sockaddr*>(&to), to_len) >= 0)
    return;
  if (failure_text && last_send_failure_log != server_now) {
    last_send_failure_log = server_now;
    log_message(failure_text, std::strerror(errno));
  }
}

// ---- listings ------------------------------------------------------------------

// A queue listing on its way: a socket connected to the reader, so that the
// loop can wait until the reader's queue has room (an unconnected socket
// cannot be told that), and the datagrams still to send.
struct Listing {
  UniqueFd fd;
  std::deque<std::string> datagrams;
  std::time_t progress = 0;  // when the reader last took one
};
// A reader that takes nothing for this long has gone: its listing is dropped.
constexpr std::time_t kListingStall = 30;
// Listings at once; a new one beyond this drops the oldest.
constexpr std::size_t kMaxListings = 32;
std::list<Listing>& listings() {
  static std::list<Listing> l;
  return l;
}

void end_listing(std::list<Listing>::iterator it) {
  unwatch(it->fd.get());
  listings().erase(it);
}

// Sends what the reader can take now; waits for room for the rest.
void send_listing(std::list<Listing>::iterator it) {
  Listing& l = *it;
  while (!l.datagrams.empty()) {
    const std::string& d = l.datagrams.front();
    if (::send(l.fd.get(), d.data(), d.size(), MSG_DONTWAIT | MSG_NOSIGNAL) < 0) {
      if (errno == EINTR) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) break;  // the reader has gone
      int fd = l.fd.get();
      if (watch_writable(fd, [fd] {
            auto& all = listings();
            for (auto i = all.begin(); i != all.end(); ++i)
              if (i->fd.get() == fd) return send_listing(i);
          }))
        return;
      break;
    }
    l.datagrams.pop_front();
    l.progress = server_now;
  }
  end_listing(it);
}

// Starts sending a listing to the reader at `to`; false when no socket of
// its own can reach the reader (the caller then sends what it can at once).
bool start_listing(const sockaddr_un& to, socklen_t to_len, std::vector<std::string> datagrams) {
  UniqueFd fd(::socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
  if (!fd || ::connect(fd.get(), reinterpret_cast<const sockaddr*>(&to), to_len) != 0) return false;
  auto& all = listings();
  if (all.size() >= kMaxListings) end_listing(all.begin());
  all.push_back(Listing{std::move(fd), {}, server_now});
  for (std::string& d : datagrams) all.back().datagrams.push_back(std::move(d));
  send_listing(std::prev(all.end()));
  return true;
}

// Every tick: a listing whose reader took nothing for too long is dropped;
// the others are offered their next datagrams again, so that a wake-up
// missed for any reason costs a tick, not the rest of the listing.
void tend_listings() {
  auto& all = listings();
  for (auto it = all.begin(); it != all.end();) {
    auto next = std::next(it);
    if (server_now - it->progress > kListingStall) {
      end_listing(it);
    } else {
      send_listing(it);
    }
    it = next;
  }
}

bool is_listing(std::string_view text) {
  while (!text.empty() && (text.back() == '\r' || text.back() == '\n')) text.remove_suffix(1);
  return str_iequals(text, "listmq") || str_iequals(text, "listnq");
}

// "log WORD" / "nolog WORD": switches one facility of the main log.
void switch_facility(std::string_view text) {
  static const struct {
    const char* word;
    std::uint32_t bit;
  } kFacilities[] = {
      {"house", logfac::house},         {"smtp", logfac::smtp},
      {"pop", logfac::pop},             {"imap", logfac::imap},
      {"maildebatch", logfac::maildebatch}, {"newsfetch", logfac::newsfetch},
      {"newsserver", logfac::newsserver}, {"newsdebatch", logfac::newsdebatch},
      {"web", logfac::web},             {"proxy", logfac::proxy},
      {"dns", logfac::dns},             {"fcache", logfac::fcache},
      {"schedule", logfac::schedule},   {"dialler", logfac::dialler},
      {"utils", logfac::utils},
  };
  const bool on = text[0] == 'l' || text[0] == 'L';
  const std::size_t word_len = on ? 3 : 5;
  if (text.size() <= word_len || text[word_len] != ' ') return;
  std::string_view name = text.substr(word_len + 1);
  for (const auto& f : kFacilities) {
    std::size_t n = std::strlen(f.word);
    if (name.size() >= n && str_ncasecmp(name, f.word, n) == 0) {
      bits_set(log_mask, f.bit, on);
      return;
    }
  }
}

// "change pass USER OLD NEW" -> "1" old password wrong, "2" changed, "0" the
// change failed. The text is never logged.
std::string change_password(std::string_view text) {
  std::vector<std::string_view> words;
  std::string_view rest = text.substr(11);
  while (!rest.empty()) {
    std::size_t start = rest.find_first_not_of(' ');
    if (start == std::string_view::npos) break;
    rest.remove_prefix(start);
    std::size_t end = rest.find(' ');
    words.push_back(rest.substr(0, end));
    rest = end == std::string_view::npos ? std::string_view() : rest.substr(end);
  }
  // Without a user database nothing can vouch for the old password.
  if (words.size() < 3 || !hooks.change_password) return "1";
  if (words[0].size() > kMaxWord || words[1].size() > kMaxWord) return "1";
  if (words[2].size() > kMaxWord) return "0";  // never cut a new password silently
  return std::to_string(hooks.change_password(words[0], words[1], words[2]));
}

std::string status_text() {
  int web = connection_count(svc::web) + connection_count(svc::web_internal);
  int proxy = connection_count(svc::proxy) + connection_count(svc::cache_request) +
              connection_count(svc::telnet) + connection_count(svc::multiport);
  long mail = hooks.outgoing_mail_count ? static_cast<long>(hooks.outgoing_mail_count()) : 0;
  return strprintf("is:%d\nmq:%ld\nnq:%d\nwf:%d\npf:%d\n", static_cast<int>(status_bits), mail, 0, web, proxy);
}

// Receives and answers the waiting requests; level-triggered readiness
// brings the loop back for the rest after a bounded batch.
void control_read() {
  const int fd = control().fd;
  for (int batch = 0; batch < 256 && fd >= 0 && control().fd == fd; ++batch) {
    char buf[kMaxRequest + 2];
    sockaddr_un from{};
    socklen_t from_len = sizeof from;
    ssize_t n = ::recvfrom(fd, buf, sizeof buf, MSG_DONTWAIT | MSG_TRUNC,
                           reinterpret_cast<sockaddr*>(&from), &from_len);
    if (n < 0) return;
    if (static_cast<std::size_t>(n) > kMaxRequest) {
      // Acting on part of a command (a cut password, say) would be worse
      // than ignoring it.
      log_message("Control request too long, ignored");
      continue;
    }
    std::string_view text(buf, static_cast<std::size_t>(n));
    text = text.substr(0, text.find('\0'));
    // A reply may also come later (a lookup's end), so it takes the
    // sender's address along and the socket open at that time.
    const char* failure = str_istarts_with(text, "change pass") ? "domain send failed (change pass) "
                                                                 : "domain send failed";
    if (is_listing(text) && from_len > sizeof(sa_family_t)) {
      std::vector<std::string> datagrams;
      control_command(text, [&datagrams](std::string_view reply) { datagrams.emplace_back(reply); });
      if (start_listing(from, from_len, datagrams)) continue;
      for (const std::string& d : datagrams) send_reply(control().fd, from, from_len, d, failure);
      continue;
    }
    control_command(text, [from, from_len, failure](std::string_view reply) {
      send_reply(control().fd, from, from_len, reply, failure);
    });
  }
}

// The subsystem sends its whole listing; without one the queue is empty,
// and the listing says so.
void list_queue(const std::function<void(const std::function<void(std::string_view)>&)>& lister,
                std::string_view end_line, const std::function<void(std::string_view)>& reply) {
  if (lister) {
    lister(reply);
    return;
  }
  reply("start mq\n");
  reply(end_line);
}

// "lookup NAME": one datagram when the lookup ends, "lookup:NAME:a.b.c.d\n"
// or "lookup:NAME:failed\n".
void lookup(std::string_view name, const std::function<void(std::string_view)>& reply) {
  auto answer = [reply, name = std::string(name)](std::string_view address) {
    reply("lookup:" + name + ":" + (address.empty() ? std::string("failed") : std::string(address)) + "\n");
  };
  if (!hooks.lookup || name.empty()) {
    answer({});
    return;
  }
  hooks.lookup(name, answer);
}

}  // namespace

void control_command(std::string_view text, const std::function<void(std::string_view)>& reply) {
  while (!text.empty() && (text.back() == '\r' || text.back() == '\n')) text.remove_suffix(1);
  if (text.empty()) return;
  // Tested first, so that its text never reaches a log.
  if (str_istarts_with(text, "change pass")) {
    reply(change_password(text));
    return;
  }
  if (str_iequals(text, "reload config")) {
    if (config_load() == 0) tls_load();  // a renewed certificate, for new connections
  } else if (str_iequals(text, "reload users")) {
    if (hooks.reload_users) hooks.reload_users();
  } else if (str_iequals(text, "reload groups")) {
    if (hooks.reload_groups) hooks.reload_groups();
  } else if (str_iequals(text, "clear mqcng")) {
    status_bits &= ~status::mail_queue_changed;
  } else if (str_iequals(text, "clear nqcng")) {
    status_bits &= ~status::news_queue_changed;
  } else if (str_istarts_with(text, "lookup ")) {
    lookup(trim_blanks(text.substr(7)), reply);
  } else if (str_istarts_with(text, "log") || str_istarts_with(text, "nolog")) {
    switch_facility(text);
  } else if (str_iequals(text, "listmq")) {
    list_queue(hooks.list_mail_queue, "end mq\n", reply);
  } else if (str_iequals(text, "listnq")) {
    list_queue(hooks.list_news_queue, "end nq\n", reply);
  } else if (str_iequals(text, "status")) {
    reply(status_text());
  } else if (str_iequals(text, "incoming")) {
    auto [waiting, retry] = hooks.incoming_mail_count ? hooks.incoming_mail_count() : std::pair<std::size_t, std::size_t>{};
    reply(strprintf("iq:%zu\nretry:%zu\n", waiting, retry));
  } else if (str_iequals(text, "test")) {
    reply(strprintf("test:%ld\n", static_cast<long>(server_now)));
  } else {
    // The internal command words, last: none of them is one of the texts
    // above, and asking "test" or "status" then costs no log line.
    internal_command(text);
  }
}

int control_open() {
  auto& c = control();
  control_remove();  // a second open replaces the first
  const std::string& path = paths.control;
  sockaddr_un a;
  socklen_t len;
  if (!make_address(path, a, len)) {
    log_write("Control socket path too long: " + path, logchan::errors);
    log_message("Control socket path too long: ", path);
    return 1;
  }
  int fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    log_write("UDP socket create for UNIX domain failed", logchan::errors);
    log_message("UDP socket create for UNIX domain failed");
    return 1;
  }
  // A folder made here is the suite's alone (group members may use velmorctl).
  if (std::size_t slash = path.find_last_of('/'); slash != std::string::npos && slash > 0) {
    std::string dir = path.substr(0, slash);
    if (::mkdir(dir.c_str(), 0750) != 0 && errno == ENOENT) {
      make_parent_dirs(dir);
      ::mkdir(dir.c_str(), 0750);
    }
  }
  remove_stale_socket(path);
  // The socket file is born with mode 0660: nobody else may steer the suite.
  mode_t old_mask = umask(0117);
  int bound = ::bind(fd, reinterpret_cast<sockaddr*>(&a), len);
  int error = errno;
  umask(old_mask);
  if (bound != 0) {
    log_write("bind() for UNIX domain failed", logchan::errors);
    log_message("bind() for UNIX domain failed:", std::to_string(error));
    log_message("The control socket cannot be made: ", path + ": " + std::strerror(error));
    ::close(fd);
    return 1;
  }
  chmod(path.c_str(), 0660);
  struct stat st{};
  if (stat(path.c_str(), &st) == 0) {
    c.dev = st.st_dev;
    c.ino = st.st_ino;
    c.made = true;
  }
  c.fd = fd;
  every_tick(tend_listings);
  if (!watch_readable(fd, control_read)) {
    control_remove();
    return 1;
  }
  return 0;
}

void control_remove() {
  auto& c = control();
  while (!listings().empty()) end_listing(listings().begin());
  if (c.fd >= 0) {
    unwatch(c.fd);
    ::close(c.fd);
    c.fd = -1;
  }
  if (!c.made) return;
  struct stat st{};
  if (stat(paths.control.c_str(), &st) == 0 && st.st_dev == c.dev && st.st_ino == c.ino)
    unlink(paths.control.c_str());
  c.made = false;
}

}  // namespace velmor
