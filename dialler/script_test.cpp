#include "dialler/script.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace velmor {
namespace {

// Every command of a script, as "letter:argument".
std::vector<std::string> commands(std::string_view text) {
  std::vector<std::string> out;
  for (ScriptLine line; (line = script_line(text)).length; text.remove_prefix(line.length))
    if (line.command) out.push_back(std::string(1, line.command) + ":" + std::string(line.argument));
  return out;
}

TEST(ScriptReader, LettersArgumentsAndLineEnds) {
  EXPECT_EQ(commands("Init\tATZ\r\n\r\n"
                     "dial \"ATDT%phone\" trailing\r"
                     "d ATDT123\n"
                     "# comment\n"
                     " w indented is skipped\n"
                     "WAIT  ogin: \n"
                     "s%user\n"
                     "p 3\n"
                     "m\n"
                     "x unknown\n"
                     "c pppd call isp"),
            (std::vector<std::string>{"i:ATZ", "d:ATDT%phone", "d:ATDT123", "w:ogin: ", "s:%user", "p:3", "m:",
                                      "c:pppd call isp"}));
  EXPECT_EQ(script_line("").length, 0u);
  EXPECT_EQ(script_line("\r\n\n").command, 0);
  EXPECT_EQ(script_line("\r\n\n").length, 3u);
  EXPECT_EQ(script_line("s abc\r\n\r\nw x").length, 9u);

  // Modem arguments stop at 120 characters; a shell command is measured
  // once its values are in.
  std::string long_text(300, 'a');
  EXPECT_EQ(script_line("s " + long_text).argument.size(), kModemArgumentMax);
  EXPECT_EQ(script_line("d \"" + long_text + "\"").argument.size(), kModemArgumentMax);
  EXPECT_EQ(script_line("c " + long_text).argument.size(), 300u);

  EXPECT_EQ(script_seconds("12 seconds"), 12);
  EXPECT_EQ(script_seconds("x"), 0);
  EXPECT_EQ(script_seconds("99999999999999999999999"), 86400);
}

TEST(ScriptReader, Substitutions) {
  ScriptValues v;
  v.user = "demo";
  v.pass = "se.cret";
  v.phone = "555-1234";
  v.driver = "/dev/ttyS0";
  v.init = "AT&F";
  v.port = 2;
  v.idle = 300;
  auto shell = script_substitute("pppd %USER:%pass %Port idle %idle %% %x %driver %phone", Substitute::shell, v);
  EXPECT_EQ(shell.text, "pppd demo:se.cret 2 idle 300 % x /dev/ttyS0 555-1234");
  EXPECT_EQ(shell.unsafe, "");
  // The modem does not know %idle: the "%" goes, the word stays.
  EXPECT_EQ(script_substitute("ATDT%phone %idle", Substitute::modem, v).text, "ATDT555-1234 idle");
  // "&" is shell syntax, so %init makes the command unsafe; the first
  // unsafe name is reported.
  EXPECT_EQ(script_substitute("echo '%init'", Substitute::shell, v).unsafe, "%init");
  for (const char* bad : {"x;touch FILE", "a'b", "$(id)", "a`b`", "a|b", "a\nb", "a>b", "a\"b", "a\\b", "*"}) {
    v.pass = bad;
    EXPECT_EQ(script_substitute("login %user %pass", Substitute::shell, v).unsafe, "%pass") << bad;
  }
  v.pass = "Az09 @._+-:/,=";
  EXPECT_EQ(script_substitute("%pass", Substitute::shell, v).unsafe, "");
}

TEST(ModemReplies, EchoesSplitReadsAndPrompts) {
  ModemReplies r;
  r.add("ATZ\r\r\nOK\r\nATDT5");
  EXPECT_EQ(r.next_line(), "ATZ");
  EXPECT_EQ(r.next_line(), "OK");
  EXPECT_EQ(r.next_line(), std::nullopt);
  EXPECT_EQ(r.unfinished(), "ATDT5");
  r.add("\r");
  EXPECT_EQ(r.next_line(), "ATDT5");
  r.add("\nCONNECT 115200\r\nWelcome\r\nlogin: ");
  EXPECT_EQ(r.next_line(), "CONNECT 115200");
  EXPECT_EQ(r.next_line(), "Welcome");
  EXPECT_EQ(r.next_line(), std::nullopt);
  EXPECT_EQ(r.unfinished(), "login: ");
  r.consume_unfinished(6);
  EXPECT_EQ(r.unfinished(), " ");

  // A flood without line ends keeps only the newest bytes.
  r.add(std::string(10000, 'x') + "Password:");
  EXPECT_EQ(r.unfinished().size(), ModemReplies::kMax);
  EXPECT_TRUE(r.unfinished().ends_with("Password:"));
}

TEST(ModemReplies, DialResultsAndOk) {
  std::string text = "unchanged";
  EXPECT_EQ(dial_result("CONNECT 115200/V42bis", &text), DialResult::connect);
  EXPECT_EQ(text, "115200/V42bis");
  EXPECT_EQ(dial_result("connect", &text), DialResult::connect);
  EXPECT_EQ(text, "");
  EXPECT_EQ(dial_result("CONNECT " + std::string(200, '9'), &text), DialResult::connect);
  EXPECT_EQ(text.size(), 100u);
  EXPECT_EQ(dial_result("BUSY", nullptr), DialResult::busy);
  EXPECT_EQ(dial_result("no carrier", nullptr), DialResult::no_carrier);
  EXPECT_EQ(dial_result("NO DIAL TONE", nullptr), DialResult::no_dial_tone);
  EXPECT_EQ(dial_result("ATDT5551234", nullptr), DialResult::none);
  EXPECT_TRUE(reply_is_ok(" ok "));
  EXPECT_FALSE(reply_is_ok("ATZ"));
  EXPECT_FALSE(reply_is_ok("OKAY"));
}

TEST(DiallerStatus, EveryState) {
  auto line = [](int state, bool up = false) { return dialler_status_line(state, "115200", up, "ogin:", 2); };
  EXPECT_EQ(line(0), "No network link and dialler is idle");
  EXPECT_EQ(line(1, true), "Dialler connected [115200]: Link Good");
  EXPECT_EQ(line(5), "Dialling number");
  EXPECT_EQ(line(7), "Login script waiting for:ogin:");
  EXPECT_EQ(line(10), "Dial failed, retries left:2");
  EXPECT_EQ(line(11), "Login script pausing");
  for (int state : {2, 4, 3})
    EXPECT_EQ(line(state), "Unknown dialler state - worry slightly");
}

}  // namespace
}  // namespace velmor
