// The POP3 session through the test driver, fed arbitrary bytes in
// arbitrary pieces by a user who knows the password (on loopback, or as a
// stranger who must use STLS first): every reply is a whole
// CR LF line (messages included), delayed answers come once the clock moves,
// and a session that did not QUIT leaves the mailbox as it was.
#include <sys/stat.h>
#include <arpa/inet.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <string>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/network.h"
#include "core/test_link.h"
#include "core/tls.h"
#include "mail/mailbox.h"
#include "mail/pop_server.h"
#include "mail/session_fuzz.h"
#include "users/groups.h"
#include "users/users.h"

using namespace velmor;

namespace {

using namespace velmor::fuzzing;

std::string message(int n, std::string_view body) {
  return mailbox_separator("MAIL FROM:<bob@far.example>", 1700000000) + "From: bob@far.example\r\nSubject: m" +
         std::to_string(n) + "\r\nStatus: RO\r\nX-Status:   \r\n\r\n" + std::string(body) + ".\r\n";
}

struct Scratch {
  ScratchFolder folder;
  std::string root = folder.path(), inbox, original;
  Scratch() {
    paths.tmp_dir = root + "/tmp";
    config.server_name = "fuzz.example";
    config.admin_email = "postmaster@site.example";
    config.sock_buffer = 1024;
    mkdir((root + "/tmp").c_str(), 0700);
    std::filesystem::create_directories(root + "/alice/mail");
    filecache_init();
    // alice's password is "secret"
    write_all(root + "/users", "alice,$1$7d1ZKX5F$d2aGUoNjVu30rj26rho90/,Alice Liddell," + root + "/alice,0\n");
    user_load(root + "/users");
    groups_parse("#0\n%mail.pop.fetch: yes\n");
    inbox = root + "/alice/mail/inbox";
    original = message(1, "Hello.\r\n..dot\r\n") + message(2, "x\r\n\r\nlast\r\n") + message(3, "");
    // A certificate, so STLS is offered and taken.
    config.tls_cert = root + "/cert.pem";
    config.tls_key = root + "/key.pem";
    if (!tls_make_self_signed(root + "/cert.pem", root + "/key.pem", "fuzz.example").empty()) std::abort();
    tls_load();
    pop_register();
  }
  void restore() {
    mailbox_cache_clear();
    std::filesystem::remove_all(root + "/alice/mail");
    std::filesystem::create_directories(root + "/alice/mail");
    write_all(inbox, original);
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Scratch scratch;
  if (size < 2) return 0;
  scratch.restore();
  const std::size_t piece = data[1] % 31 + 1;
  std::string_view input(reinterpret_cast<const char*>(data + 2), size - 2);
  server_now = 1700000000;
  bool quit = false;
  {
    // The first byte's low bit: a stranger, with passwords in the clear refused.
    const bool stranger = data[0] & 1;
    config.tls_plain_login = !stranger;
    TestLink link(svc::pop, stranger ? Peer{inet_addr("192.0.2.9"), 4000, "192.0.2.9"} : Peer{});
    link.feed(input, piece);
    for (int i = 0; i < 4 && !link.closed(); ++i) link.advance(std::chrono::seconds(1));
    link.finish();
    for (int i = 0; i < 4 && !link.closed(); ++i) link.advance(std::chrono::seconds(1));
    check(link.closed());
    check_lines(link.output());
    quit = link.output().find(" shutdown (") != std::string::npos;
  }
  // Only QUIT applies deletions.
  if (!quit) check(read_all(scratch.inbox) == scratch.original);
  return 0;
}
