// The POP3 client's reply and message reader through the test driver: a
// server sends arbitrary bytes in arbitrary pieces (after a login and the
// listings, when the first byte asks for them). Every command sent is a
// whole CR LF line, no message is deleted that is neither in the queue nor
// in the account's record of queued messages, every queued file is a whole
// message, and a connection that ends leaves no half-written file. An
// account that asks for STLS never sends its login in the clear. When the
// first byte asks, the input is the account's record instead: what is read
// from it is written back the same, and the session that follows starts
// from it.
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>

#include "core/config.h"
#include "core/filecache.h"
#include "core/globals.h"
#include "core/network.h"
#include "core/test_link.h"
#include "core/util.h"
#include "mail/pop_client.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/session_fuzz.h"

using namespace velmor;

namespace {

using namespace velmor::fuzzing;

struct Scratch {
  ScratchFolder folder;
  std::string root = folder.path(), in = root + "/in";
  Scratch() {
    paths.tmp_dir = root + "/tmp";
    std::filesystem::create_directories(root + "/pop");
    config.server_name = "fuzz.example";
    config.sock_buffer = 1024;
    config.mail_dir_incoming = in;
    mkdir((root + "/tmp").c_str(), 0700);
    filecache_init();
    pop_client_register();
  }
  void clear() {
    std::filesystem::remove_all(in);
    std::filesystem::create_directories(in);
    while (queue_pop_incoming()) {
    }
  }
};

std::size_t count(const std::string& text, std::string_view what) {
  std::size_t n = 0;
  for (std::size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Scratch scratch;
  if (size < 2) return 0;
  scratch.clear();
  const std::size_t piece = data[1] % 31 + 1;
  std::string input(reinterpret_cast<const char*>(data + 2), size - 2);
  const PopAccount account{"u", "p", "h.example", 110, (data[0] & 4) != 0,
                           (data[0] & 8) != 0 ? PopTls::stls : PopTls::none};
  std::filesystem::remove_all(scratch.root + "/pop");
  std::size_t remembered = 0;
  if (data[0] & 32) {
    std::set<std::string> ids = pop_state_parse(input);
    std::string text = pop_state_text(account, ids);
    check(pop_state_parse(text) == ids);
    check(text.empty() == ids.empty());
    // The session after it finds the record, and the messages "a" and "b".
    std::filesystem::create_directories(scratch.root + "/pop");
    std::ofstream(scratch.root + "/pop/" + md5_hex("u\nh.example:110")) << text;
    remembered = ids.size();
    input = "+OK\r\n+OK\r\n+OK\r\n+OK\r\nUIDL\r\n.\r\n+OK 2 0\r\n+OK\r\n.\r\n+OK\r\n1 a\r\n2 b\r\n.\r\n";
  } else if (data[0] & 1) {
    input = "+OK\r\n+OK\r\n+OK\r\n" + std::string(data[0] & 2 ? "+OK\r\nPIPELINING\r\n.\r\n" : "-ERR\r\n") +
            "+OK 3 0\r\n+OK\r\n1 10\r\n2 20\r\n3 30\r\n.\r\n+OK\r\n1 x\r\n2 y\r\n3 z\r\n.\r\n" + input;
  }
  server_now = 1700000000;
  std::string sent;
  const bool stls = account.tls == PopTls::stls;
  if (stls && (data[0] & 1)) input = "+OK\r\n" + input;  // the answer to STLS
  {
    TestLink link(pop_client_session(account));
    if (data[0] & 16) link.refuse_tls();
    link.feed(input, piece);
    link.advance(std::chrono::seconds(1));  // a batch waiting for more is committed
    link.finish();
    link.advance(std::chrono::seconds(1));
    check(link.closed());
    sent = link.output();
    if (stls) check(link.clear_output().find("USER") == std::string_view::npos &&
                    link.clear_output().find("PASS") == std::string_view::npos);
  }
  check_lines(sent);
  std::size_t files = 0;
  for (const auto& e : std::filesystem::directory_iterator(scratch.in)) {
    std::string name = e.path().filename().string();
    check(name.find_first_not_of("0123456789") == std::string::npos);  // nothing half written
    std::string text = read_all(e.path().string());
    check(text.starts_with("POP3 MAIL FROM:<u@h.example>\r\n") && text.ends_with("\r\n.\r\n"));
    ++files;
  }
  check(count(sent, "DELE ") <= files + remembered);
  return 0;
}
