#include "core/config.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <unistd.h>


#include "core/strfmt.h"
#include "core/test_files.h"

namespace velmor {
namespace {

std::uint32_t ip(const char* text) { return inet_addr(text); }

using testing_files::read_file;
using testing_files::write_file;

class ConfigTest : public ::testing::Test {
 protected:
  void SetUp() override {
    config_reset();
    ASSERT_FALSE(scratch_.path().empty());
    dir_ = scratch_.path().string();
  }
  void TearDown() override { config_reset(); }
  int load(std::string_view text) {
    write_file(dir_ + "/master", text);
    return config_load_file(dir_ + "/master");
  }
  testing_files::ScratchDir scratch_;
  std::string dir_;
};

TEST_F(ConfigTest, FileSyntax) {
  std::string long_value(5000, 'x');
  ASSERT_EQ(load("text before any key is ignored\n"
                 "%smtp.sock.port:25\n"
                 "%SMTP.SOCK.MAX:   7\r\n"
                 "| a comment line\n"
                 "%smtp.allow: 10.0.0.0/8\n"
                 "\t192.168.1.5\n"
                 "\n"
                 "%admin.email: root@example.org  \n"
                 "# not a comment: part of the value\n"
                 "%server.name:" + long_value + "\n"
                 "%no.such.key: 1\n"
                 "%pop.hosts:\n"),
            0);
  EXPECT_EQ(config.smtp_sock_port, 25);
  EXPECT_EQ(config.smtp_sock_max, 7);
  EXPECT_EQ(config_key("smtp.allow"), "10.0.0.0/8, 192.168.1.5/32");
  // Trailing blanks stay part of a string; a "#" line is a continuation.
  EXPECT_EQ(config.admin_email, "root@example.org  ,# not a comment: part of the value");
  // Lines of any length are read whole.
  EXPECT_EQ(config.server_name, long_value);
  // Given but empty differs from never given.
  EXPECT_EQ(config.pop_hosts, "");
  EXPECT_FALSE(config.pop_headers.has_value());
  EXPECT_EQ(config_key("pop.headers"), std::nullopt);
  EXPECT_EQ(config_key("no.such.key"), std::nullopt);
  // Keys missing from the file keep their value.
  EXPECT_EQ(config.imap_sock_port, 143);
}

TEST_F(ConfigTest, TheAdministratorsAddressKeepsItsDomainAcrossReloads) {
  const char* master = "%admin.email: postmaster\n%server.name: host.example\n%mail.domains: , site.example, b.example\n";
  ASSERT_EQ(load(master), 0);
  EXPECT_EQ(admin_address(), "postmaster@site.example");
  EXPECT_EQ(config_key("admin.email"), "postmaster");  // saved as written
  ASSERT_EQ(load("%mail.domains:\n"), 0);
  EXPECT_EQ(admin_address(), "postmaster@host.example");
  ASSERT_EQ(load("%admin.email: ops@far.example\n"), 0);
  EXPECT_EQ(admin_address(), "ops@far.example");
}

TEST_F(ConfigTest, MissingFileIsReported) {
  ::testing::internal::CaptureStdout();
  EXPECT_EQ(config_load_file(dir_ + "/absent"), 1);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(), "Couldn't open config file:" + dir_ + "/absent\n");
}

TEST_F(ConfigTest, ValueKinds) {
  config_key("cache.big", "64");
  EXPECT_EQ(config.cache_big, 65536);
  EXPECT_EQ(config_key("cache.big"), "64");
  config_key("sock.buffer", "99999999999999");  // saturates instead of wrapping
  EXPECT_EQ(config.sock_buffer, 2147483647);
  config_key("sock.buffer", "12abc");
  EXPECT_EQ(config.sock_buffer, 12);
  EXPECT_EQ(socket_buffer_size(), 1024);
  config_key("cache.max", "9999999");
  EXPECT_EQ(config.cache_max, 2147483647);

  config_key("proxy.cache.request.start", "7:05");
  EXPECT_EQ(config.proxy_cache_request_start, time_of_day(7, 5));
  EXPECT_EQ(config_key("proxy.cache.request.start"), " 7: 5");
  for (const char* v : {"7,30", "7;30", "7 30", " 7:30"}) {
    config_key("proxy.cache.request.end", v);
    EXPECT_EQ(config.proxy_cache_request_end, time_of_day(7, 30)) << v;
  }
  config_key("proxy.cache.request.end", "9");
  EXPECT_EQ(config.proxy_cache_request_end, time_of_day(9, 0));

  for (const char* yes : {"maybe", "", "yes", "1"}) {
    config_key("web.sock.enabled", "no");
    config_key("web.sock.enabled", yes);
    EXPECT_TRUE(config.web_sock_enabled) << yes;
  }
  for (const char* no : {"OFF", "no", "False", "0", "no  "}) {
    config_key("web.sock.enabled", no);
    EXPECT_FALSE(config.web_sock_enabled) << no;
  }
  EXPECT_EQ(config_key("web.sock.enabled"), "no");

  EXPECT_EQ(yes_no_word(""), 1);
  EXPECT_EQ(yes_no_word("  No"), 0);
  EXPECT_EQ(yes_no_word("oFf"), 0);
  EXPECT_EQ(yes_no_word("on"), 1);
  EXPECT_EQ(yes_no_word("o"), 1);
  EXPECT_EQ(yes_no_word("yes"), 1);
}

TEST_F(ConfigTest, AddressLists) {
  auto list = address_list_parse("10.1.0.0/16, 10.2.3.4 255.255.255.0");
  ASSERT_EQ(list.size(), 2u);
  EXPECT_EQ(address_list_text(list), "10.1.0.0/16, 10.2.3.4/24");
  EXPECT_TRUE(address_list_match(list, ip("10.1.200.9")));
  EXPECT_TRUE(address_list_match(list, ip("10.2.3.99")));
  EXPECT_FALSE(address_list_match(list, ip("10.3.0.1")));

  // The whole prefix counts: /12 is twelve bits, written back as a mask.
  list = address_list_parse("10.0.0.0/12");
  ASSERT_EQ(list.size(), 1u);
  EXPECT_EQ(list[0].mask, htonl(0xfff00000u));
  EXPECT_TRUE(address_list_match(list, ip("10.15.255.255")));
  EXPECT_FALSE(address_list_match(list, ip("10.16.0.0")));
  EXPECT_EQ(address_list_text(list), "10.0.0.0 255.240.0.0");
  EXPECT_EQ(address_list_parse(address_list_text(list)), list);

  EXPECT_EQ(address_list_text(address_list_parse("1.2.3.4/0,1.2.3.4/8,1.2.3.4/32,1.2.3.4")),
            "1.2.3.4/0, 1.2.3.4/8, 1.2.3.4/32, 1.2.3.4/32");
  // A bad prefix or mask leaves the single host; a bad address drops the item.
  EXPECT_EQ(address_list_text(address_list_parse("1.2.3.4/x, 1.2.3.4/33, 1.2.3.4 9.9")),
            "1.2.3.4/32, 1.2.3.4/32, 1.2.3.4/32");
  list = address_list_parse("bogus, 10.0.0.1, 300.1.1.1, 10.0.0.1.5");
  ASSERT_EQ(list.size(), 1u);
  EXPECT_EQ(list[0].address, ip("10.0.0.1"));

  list = address_list_parse("ALL");
  EXPECT_TRUE(address_list_match(list, ip("192.0.2.1")));
  EXPECT_EQ(address_list_text(address_list_parse("*, None")), "all, none");
  list = address_list_parse("none");
  EXPECT_FALSE(address_list_match(list, ip("192.0.2.1")));
  EXPECT_TRUE(address_list_parse("").empty());
  EXPECT_FALSE(address_list_match({}, ip("10.0.0.1")));

  // A long list is kept whole.
  std::string many;
  for (int i = 0; i < 200; ++i) many += strprintf("%s10.0.%d.0/24", i ? ", " : "", i);
  config_key("smtp.block", many);
  EXPECT_EQ(config.smtp_block.size(), 200u);
  EXPECT_EQ(config_key("smtp.block"), many);
}

// Every key survives load -> save -> load with its value, strings keep their
// commas and blanks, and the save keeps the old file as master~.
TEST_F(ConfigTest, SaveRoundTripKeepsEveryValue) {
  std::string master = dir_ + "/master", tmpl = dir_ + "/template";
  std::string template_text = "| Velmor master configuration\n";
  std::string master_text;
  int n = 0;
  for (const auto& k : config_keys()) {
    ++n;
    template_text += strprintf("%%%s: \n", k.name);
    switch (k.kind) {
      case ConfigKind::integer: master_text += strprintf("%%%s: %d\n", k.name, 1000 + n); break;
      case ConfigKind::string: master_text += strprintf("%%%s: value %d, with comma  \n", k.name, n); break;
      case ConfigKind::boolean: master_text += strprintf("%%%s: %s\n", k.name, n % 2 ? "no" : "yes"); break;
      case ConfigKind::time_of_day: master_text += strprintf("%%%s: %d:%d\n", k.name, n % 24, n % 60); break;
      case ConfigKind::address_list:
        master_text += strprintf("%%%s: 10.%d.0.0/16,\n\t192.168.%d.1 255.255.252.0\n", k.name, n % 256, n % 256);
        break;
    }
  }
  template_text += "continuation lines of the template are not copied\n";
  write_file(tmpl, template_text);
  write_file(master, master_text);
  ASSERT_EQ(config_load_file(master), 0);
  std::vector<std::optional<std::string>> before;
  for (const auto& k : config_keys()) before.push_back(config_key(k.name));

  ASSERT_EQ(config_save_files(tmpl, master), 0);
  EXPECT_EQ(read_file(master + "~"), master_text);
  std::string saved = read_file(master);
  EXPECT_EQ(saved.rfind("| Velmor master configuration\n", 0), 0u);
  EXPECT_EQ(saved.find("continuation lines"), std::string::npos);

  config_reset();
  ASSERT_EQ(config_load_file(master), 0);
  std::size_t i = 0;
  for (const auto& k : config_keys()) EXPECT_EQ(config_key(k.name), before[i++]) << k.name;
}

TEST_F(ConfigTest, SaveKeepsTemplateLinesOfUnsetStrings) {
  std::string master = dir_ + "/master", tmpl = dir_ + "/template";
  write_file(tmpl, "%admin.email: postmaster\n%smtp.sock.port: 1\n");
  config_key("smtp.sock.port", "2525");
  ASSERT_EQ(config_save_files(tmpl, master), 0);
  EXPECT_EQ(read_file(master), "%admin.email: postmaster\n%smtp.sock.port: 2525\n");
}

TEST_F(ConfigTest, SaveWithoutTemplateLeavesMasterIntact) {
  std::string master = dir_ + "/master";
  write_file(master, "%smtp.sock.port: 25\n");
  config_key("smtp.sock.port", "2525");
  EXPECT_NE(config_save_files(dir_ + "/no-template", master), 0);
  EXPECT_EQ(read_file(master), "%smtp.sock.port: 25\n");
  EXPECT_NE(access((master + "~").c_str(), F_OK), 0);
}

}  // namespace
}  // namespace velmor
