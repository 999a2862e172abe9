// The IMAP command reader through the test driver: a logged-in user's
// session fed arbitrary bytes in arbitrary pieces. Every response is whole
// CR LF lines once the literals it announces are counted out, the session
// ends when the client goes, and whatever the commands did to the mailboxes
// leaves each one parsing back to the messages it holds.
#include <sys/stat.h>

#include <charconv>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <string>

#include "core/background.h"
#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/network.h"
#include "core/test_link.h"
#include "mail/imap_server.h"
#include "mail/mailbox.h"
#include "mail/session_fuzz.h"
#include "users/groups.h"
#include "users/users.h"

using namespace velmor;

namespace {

using namespace velmor::fuzzing;

std::string message(int n, std::string_view extra, std::string_view body) {
  return mailbox_separator("MAIL FROM:<bob@far.example>", 1700000000 + n) + "From: bob@far.example\r\nSubject: m" +
         std::to_string(n) + "\r\n" + std::string(extra) + "X-UID: " + std::to_string(n) + "\r\n\r\n" +
         std::string(body) + ".\r\n";
}

struct Scratch {
  ScratchFolder folder;
  std::string root = folder.path(), home = root + "/alice", inbox = home + "/mail/inbox", original;
  Scratch() {
    paths.tmp_dir = root + "/tmp";
    config.server_name = "fuzz.example";
    config.admin_email = "postmaster@site.example";
    config.sock_buffer = 1024;
    mkdir(paths.tmp_dir.c_str(), 0700);
    filecache_init();
    // alice's password is "secret"
    write_all(root + "/users", "alice,$1$7d1ZKX5F$d2aGUoNjVu30rj26rho90/,Alice Liddell," + home + ",0\n");
    user_load(root + "/users");
    groups_parse("#0\n%mail.imap.fetch: yes\n%mail.msg.size: 4\n");
    original = message(1, "", "Hello.\r\n..dot\r\n") +
               message(2, "Content-Type: multipart/mixed; boundary=b\r\n",
                       "--b\r\nContent-Type: text/plain\r\n\r\none\r\n--b\r\n\r\ntwo\r\n--b--\r\n") +
               message(3, "", "");
    imap_register();
  }
  void restore() {
    mailbox_cache_clear();
    std::filesystem::remove_all(home);
    std::filesystem::create_directories(home + "/mail");
    write_all(inbox, original);
  }
};

// The responses as a client reads them: lines, and in them literals of
// the length they announce.
void check_responses(const std::string& out) {
  std::size_t i = 0;
  while (i < out.size()) {
    std::size_t lf = out.find('\n', i);
    check(lf != std::string::npos && lf > i && out[lf - 1] == '\r');
    std::string_view line(out.data() + i, lf - 1 - i);
    check(line.find('\r') == std::string_view::npos);
    i = lf + 1;
    if (line.ends_with("}")) {
      std::size_t open = line.rfind('{');
      check(open != std::string_view::npos);
      std::uint64_t n = 0;
      auto r = std::from_chars(line.data() + open + 1, line.data() + line.size() - 1, n);
      check(r.ec == std::errc() && n <= out.size() - i);
      i += n;
      // the response goes on, or ends with a literal (a listed name)
      check(i < out.size() && (out[i] == ' ' || out[i] == ')' || out[i] == '\r'));
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Scratch scratch;
  if (size < 2) return 0;
  scratch.restore();
  const std::size_t piece = data[1] % 31 + 1;
  std::string input = "l LOGIN alice secret\r\ns SELECT INBOX\r\n";
  input.append(reinterpret_cast<const char*>(data + 2), size - 2);
  server_now = 1700000000;
  {
    TestLink link(svc::imap);
    auto background = [&] {  // a long SEARCH goes on there
      while (background_round()) {
      }
      link.turn();
    };
    link.feed(input, piece);
    background();
    for (int i = 0; i < 4 && !link.closed(); ++i) {
      link.advance(std::chrono::seconds(1));
      background();
    }
    link.finish();
    for (int i = 0; i < 4 && !link.closed(); ++i) {
      link.advance(std::chrono::seconds(1));
      background();
    }
    check(link.closed());
    check_responses(link.output());
  }
  // Every mailbox left parses back: what it holds is whole messages.
  mailbox_cache_clear();
  if (Mailbox* box = mailbox_lookup(scratch.inbox, scratch.home)) {
    std::uint64_t sum = 0;
    for (const auto& m : box->messages) sum += m.total_length;
    check(sum == mailbox_size(*box));
  }
  return 0;
}
