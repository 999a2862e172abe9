// The example of "Writing a protocol" in docs/ARCHITECTURE.md, compiled and
// run here; the test also checks that the document shows this very code.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "core/network.h"
#include "core/test_fixture.h"
#include "core/test_link.h"
#include "core/util.h"

namespace velmor {
namespace {

std::int32_t echo_port = 7007;  // a real service points at its config keys

// ---- example begins
// "ECHO text" answers "+text", "QUIT" says how many and ends the session.
class EchoSession final : public Session {
 public:
  void on_open(Connection& c) override { c.send("+ready\r\n"); }
  void on_input(Connection& c) override {
    std::string_view line;
    for (;;) {
      LineResult r = c.read_line(line);
      if (r == LineResult::need_more) return;  // wait for more input
      if (r == LineResult::overlong) {
        c.send("-line too long\r\n");
        continue;
      }
      if (str_istarts_with(line, "ECHO ")) {
        ++echoed_;
        c.send("+" + std::string(line.substr(5)) + "\r\n");
      } else if (str_iequals(line, "QUIT")) {
        c.send("+bye after " + std::to_string(echoed_) + "\r\n");
        c.close_after_send();
        return;
      } else {
        c.send("-unknown command\r\n");
      }
    }
  }

 private:
  int echoed_ = 0;  // the protocol's own state lives in its session
};

void echo_register() {
  service_register({.number = 7, .name = "echo", .port = &echo_port,
                    .make_session = [](Connection&, Admission) { return std::make_unique<EchoSession>(); },
                    .line_limit = 100});
}
// ---- example ends

using ProtocolExample = SuiteTest;

TEST_F(ProtocolExample, RunsOnTheTestDriver) {
  echo_register();
  TestLink link(7);
  link.feed("ECHO hello\r\nNOPE\r\nECHO " + std::string(200, 'x') + "\r\nQUIT\r\nECHO late\r\n", 3);
  EXPECT_EQ(link.output(), "+ready\r\n+hello\r\n-unknown command\r\n-line too long\r\n+bye after 1\r\n");
  EXPECT_EQ(link.reason(), CloseReason::requested);
}

// What lies between the markers here is the code block of the document.
TEST_F(ProtocolExample, IsTheOneInTheArchitectureNotes) {
  auto slurp = [](const std::string& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  };
  std::string self = slurp(std::string(VELMOR_SOURCE_DIR) + "/core/protocol_example_test.cpp");
  std::string doc = slurp(std::string(VELMOR_SOURCE_DIR) + "/docs/ARCHITECTURE.md");
  const std::string begin = "// ---- example begins\n", end = "// ---- example ends";
  std::size_t a = self.find(begin) + begin.size();
  std::string code = self.substr(a, self.find(end, a) - a);
  std::size_t at = doc.find("## Writing a protocol");
  ASSERT_NE(at, std::string::npos);
  at = doc.find("```cpp\n", at);
  ASSERT_NE(at, std::string::npos);
  at += 7;
  EXPECT_EQ(doc.substr(at, doc.find("```", at) - at), code);
}

}  // namespace
}  // namespace velmor
