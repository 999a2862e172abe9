// The SMTP session through the test driver, fed arbitrary bytes in
// arbitrary pieces. As a command stream (on the SMTP port from loopback or
// from afar, or on a submission port, with a certificate loaded so STARTTLS
// and AUTH run, and the clock moved past every late answer to a wrong
// password): every reply is a whole CR LF line and nothing is left
// half-written in the queue. As a message: whatever its
// lines, the message stored is the one sent.
#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <arpa/inet.h>

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
#include "core/util.h"
#include "mail/queue.h"
#include "mail/queue_internal.h"
#include "mail/session_fuzz.h"
#include "mail/smtp_server.h"
#include "users/groups.h"
#include "users/users.h"

using namespace velmor;

namespace {

using namespace velmor::fuzzing;

struct Scratch {
  ScratchFolder folder;
  std::string root = folder.path();
  Scratch() {
    paths.tmp_dir = root + "/tmp";
    config.mail_dir_incoming = root + "/in";
    config.mail_dir_outgoing = root + "/out";
    config.mail_dir_oddments = root + "/odd";
    config.mail_domains = "site.example, localhost";
    config.server_name = "fuzz.example";
    config.admin_email = "postmaster@site.example";
    config.sock_buffer = 1024;  // long lines pass through in parts
    for (const char* d : {"/in", "/out", "/odd", "/tmp"}) mkdir((root + d).c_str(), 0700);
    filecache_init();
    queue_init(1000);
    // ann's password is "secret" (AUTH PLAIN AGFubgBzZWNyZXQ=).
    write_all(root + "/users", "ann," + md5_crypt("secret", "$1$fuzzsalt$") + ",Ann," + root + "/ann,0\n");
    user_load(root + "/users");
    groups_parse("#0\n%mail.smtp.send: yes\n");
    if (tls_make_self_signed(root + "/cert.pem", root + "/key.pem", "fuzz.example").empty()) {
      config.tls_cert = root + "/cert.pem";
      config.tls_key = root + "/key.pem";
      tls_load();
    }
    smtp_register();
    tls_register_services();
  }
  // Every queue file the input made (name and content), removed.
  std::vector<std::pair<std::string, std::string>> take_files() {
    std::vector<std::pair<std::string, std::string>> files;
    for (const auto& e : std::filesystem::directory_iterator(root + "/in")) {
      files.emplace_back(e.path().filename().string(), read_all(e.path().string()));
      std::filesystem::remove(e.path());
    }
    queue_scan_incoming();
    return files;
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  static Scratch scratch;
  if (size < 2) return 0;
  const bool as_message = data[0] & 1;
  const std::size_t piece = data[1] % 31 + 1;
  std::string_view input(reinterpret_cast<const char*>(data + 2), size - 2);
  server_now = 1700000000;
  if (!as_message) {
    {
      const int where = (data[0] >> 1) & 3;
      const int service[] = {svc::smtp, svc::submission, svc::smtps, svc::smtp};
      Peer peer{};
      if (where == 3) peer = Peer{inet_addr("192.0.2.9"), 4000, "192.0.2.9"};
      TestLink link(service[where], peer);
      link.feed(input, piece);
      for (int i = 0; i < 4 && !link.closed(); ++i) link.advance(std::chrono::seconds(1));
      link.finish();
      check_lines(link.output());
    }
    // Nothing half-written is left behind.
    for (const auto& [name, text] : scratch.take_files()) check(name[0] != '.');
    return 0;
  }
  // The input's lines as a message (with a Date, so none is added),
  // dot-stuffed for the wire.
  std::string stuffed = "Date: Mon, 1 Jan 2024 00:00:00 +0000\r\n";
  for (std::size_t at = 0; at <= input.size();) {
    std::size_t end = std::min(input.find('\n', at), input.size());
    std::string line(input.substr(at, end - at));
    std::erase(line, '\r');
    stuffed += (line.starts_with(".") ? "." : "") + line + "\r\n";
    at = end + 1;
  }
  std::string reply;
  {
    TestLink link(svc::smtp);
    link.feed("MAIL FROM:<a@far.example>\r\nRCPT TO:<ann@site.example>\r\nDATA\r\n" + stuffed + ".\r\n", piece);
    reply = link.output();
    check_lines(reply);
  }
  check(reply.ends_with("\r\n250 OK\r\n"));
  auto files = scratch.take_files();
  check(files.size() == 1);
  const std::string& text = files[0].second;
  const std::string mark = "\r\nX-Sender: a@far.example\r\n";
  std::size_t at = text.find(mark);
  check(at != std::string::npos && text.substr(at + mark.size()) == stuffed + ".\r\n");
  return 0;
}
