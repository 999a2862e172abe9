// The Connection by itself, through the test driver: the line reader, the
// output queue, back-pressure, timers and the close path, no sockets.
#include "core/connection.h"

#include <fcntl.h>
#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "core/test_files.h"
#include "core/test_fixture.h"
#include "core/test_link.h"

namespace velmor {
namespace {

// Records every line (or overlong mark) it reads; replies as told.
class Lines : public Session {
 public:
  std::vector<std::string> got;
  std::vector<CloseReason> closes;
  std::string reply = "ok\r\n";  // queued per line ("" none)
  int drained = 0, timers = 0;
  std::function<void(Connection&, std::string_view)> on_line;
  void on_input(Connection& c) override {
    std::string_view line;
    for (;;) {
      LineResult r = c.read_line(line);
      if (r == LineResult::need_more) return;
      got.push_back(r == LineResult::overlong ? "<overlong>" : std::string(line));
      if (on_line) on_line(c, line);
      c.send(reply);
    }
  }
  void on_drained(Connection&) override { ++drained; }
  void on_timer(Connection& c) override {
    ++timers;
    c.send("tick\r\n");
  }
  void on_close(Connection&, CloseReason r) override { closes.push_back(r); }
};

struct Fixture : SuiteTest {
  Lines* lines = nullptr;
  std::unique_ptr<TestLink> link;
  void open(std::size_t capacity = 64, LineEnds ends = LineEnds::lf, std::size_t limit = 0) {
    auto s = std::make_unique<Lines>();
    lines = s.get();
    link = std::make_unique<TestLink>(std::move(s), capacity);
    link->connection().set_line_ends(ends);
    link->connection().set_line_limit(limit);
  }
};
using LineReader = Fixture;
using OutputQueue = Fixture;
using ConnectionLife = Fixture;

TEST_F(LineReader, CrLfSplitAnywhereBareLfAndNulBytes) {
  open();
  const std::string input("one\r\ntwo\nth\0ree\r\n\r\nlast", 23);
  for (std::size_t piece : {1, 2, 3, 7}) {
    lines->got.clear();
    link->feed(input + "\r\n", piece);
    EXPECT_EQ(lines->got, (std::vector<std::string>{"one", "two", std::string("th\0ree", 6), "", "last"})) << piece;
  }
}

TEST_F(LineReader, AnOverlongLineIsReportedOnceAndSkippedWhateverTheBufferSize) {
  open(64, LineEnds::lf, 10);
  link->feed("0123456789\r\n01234567890\r\nok\r\n");  // the limit is the line without its end
  EXPECT_EQ(lines->got, (std::vector<std::string>{"0123456789", "<overlong>", "ok"}));
  lines->got.clear();
  // Far longer than the buffer, in pieces: one report, then the next line.
  link->feed(std::string(100000, 'x') + "\r\nnext\r\n", 13);
  EXPECT_EQ(lines->got, (std::vector<std::string>{"<overlong>", "next"}));
  // Without a limit the buffer is the limit.
  open(64, LineEnds::lf, 0);
  link->feed(std::string(200, 'y') + "\nafter\n", 50);
  EXPECT_EQ(lines->got, (std::vector<std::string>{"<overlong>", "after"}));
  EXPECT_FALSE(link->closed());
}

TEST_F(LineReader, ABareCrEndsALineWhenAskedAndItsLateLfBelongsToIt) {
  open(64, LineEnds::cr_too);
  link->feed("NOOP\r");
  EXPECT_EQ(lines->got, std::vector<std::string>{"NOOP"});
  link->feed("\nNEXT\rLAST\n");
  EXPECT_EQ(lines->got, (std::vector<std::string>{"NOOP", "NEXT", "LAST"}));
}

// Literals and message bodies: exact byte counts beside the lines.
TEST_F(LineReader, ExactByteCountsBesideLines) {
  struct Literal : Session {
    std::vector<std::string> parts;
    std::size_t want = 0;
    void on_input(Connection& c) override {
      for (;;) {
        if (want) {
          std::string_view in = c.buffered();
          if (in.size() < want) return;
          parts.emplace_back(in.substr(0, want));
          c.consume(want);
          want = 0;
          continue;
        }
        std::string_view line;
        if (c.read_line(line) != LineResult::line) return;
        parts.emplace_back(line);
        if (line.starts_with("{")) want = std::stoul(std::string(line.substr(1)));
      }
    }
  };
  auto s = std::make_unique<Literal>();
  Literal* l = s.get();
  TestLink literal(std::move(s), 32);
  const char in[] = "A {5}\r\n{12}\r\nab\r\nc\n\0def\r\nB\r\n";
  literal.feed(std::string_view(in, sizeof in - 1), 1);
  EXPECT_EQ(l->parts, (std::vector<std::string>{"A {5}", "{12}", std::string("ab\r\nc\n\0def\r\n", 12), "B"}));
}

TEST_F(LineReader, OnlyAWholeLineRestartsTheIdleClock) {
  open();
  const std::time_t start = server_now;
  server_now = start + 10;
  link->feed("no line end yet");
  EXPECT_EQ(link->connection().last_active(), start);
  server_now = start + 20;
  link->feed("\n");
  EXPECT_EQ(link->connection().last_active(), start + 20 - 0);
}

// A client that pipelines without reading: input is held back once the
// output reaches the high-water mark, so memory stays bounded; once the
// client reads, every command is answered in order.
TEST_F(OutputQueue, APipeliningClientThatDoesNotReadCostsBoundedMemory) {
  open(4096);
  lines->reply = std::string(200, 'r') + "\r\n";
  link->peer_window(0);
  std::string input;
  for (int i = 0; i < 5000; ++i) input += "c" + std::to_string(i) + "\n";
  link->feed(input, 1000);
  EXPECT_GE(link->connection().pending(), Connection::kHighWater);
  EXPECT_LE(link->connection().pending(), Connection::kHighWater + 202);
  EXPECT_LT(lines->got.size(), 5000u);
  EXPECT_EQ(lines->drained, 0);
  link->peer_window(std::numeric_limits<std::size_t>::max());
  EXPECT_EQ(lines->got.size(), 5000u);
  EXPECT_EQ(lines->got.back(), "c4999");
  EXPECT_GE(lines->drained, 1);
  EXPECT_EQ(link->output().size(), 5000u * 202);
  EXPECT_EQ(link->connection().pending(), 0u);
}

TEST_F(OutputQueue, FileRangesLargerThanTheBufferWithTheirTransforms) {
  testing_files::ScratchDir dir;
  const std::string path = (dir.path() / "f").string();
  // A lone "." line whose dot ends the first 64 KB read and whose line end
  // begins the next one.
  std::string text;
  while (text.size() < 65535) text += "p\r\n";
  for (int i = 0; text.size() < 300000; ++i) text += i % 5 == 0 ? ".\r\n" : (i % 3 ? "line " : ".dot ") + std::to_string(i) + "\r\n";
  testing_files::write_file(path, text);
  auto file = std::make_shared<const UniqueFd>(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  std::string stuffed, unstuffed, lone_stuffed;
  for (std::size_t at = 0; at < text.size();) {
    std::size_t end = text.find('\n', at) + 1;
    std::string line = text.substr(at, end - at);
    stuffed += (line[0] == '.' ? "." : "") + line;
    unstuffed += line[0] == '.' ? line.substr(1) : line;
    lone_stuffed += (line == ".\r\n" ? "." : "") + line;
    at = end;
  }
  for (auto [transform, expected] : {std::pair{FileRange::Transform::none, text},
                                     {FileRange::Transform::dot_stuff, stuffed},
                                     {FileRange::Transform::dot_unstuff, unstuffed},
                                     {FileRange::Transform::stuff_lone_dots, lone_stuffed}}) {
    open();
    link->peer_window(1000);  // a slow reader: the stage refills many times
    Connection& c = link->connection();
    link->take();
    // Sent from outside any callback (as a commit's reply is): queued, then served.
    c.send("<");
    c.send_file({.file = file, .offset = 0, .length = text.size(), .transform = transform});
    c.send(">");
    EXPECT_EQ(c.pending(), text.size() + 2);
    link->turn();
    while (c.pending() > 0) link->peer_window(7919);
    EXPECT_TRUE(link->take() == "<" + expected + ">") << static_cast<int>(transform);
  }
}

TEST_F(OutputQueue, AReplyAroundAShortFileGoesInOneWrite) {
  testing_files::ScratchDir dir;
  const std::string path = (dir.path() / "small").string();
  testing_files::write_file(path, "body\r\n");
  auto file = std::make_shared<const UniqueFd>(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  open();
  lines->on_line = [&](Connection& c, std::string_view) {
    c.send("* 1 FETCH (BODY[] {6}\r\n");
    c.send_file({.file = file, .offset = 0, .length = 6});
    c.send(")\r\n");
  };
  link->take();
  const int before = link->writes();
  link->feed("a\n");
  EXPECT_EQ(link->take(), "* 1 FETCH (BODY[] {6}\r\nbody\r\n)\r\nok\r\n");
  EXPECT_EQ(link->writes() - before, 1);  // no closing line trailing in a segment of its own
}

TEST_F(OutputQueue, AFileThatCannotBeReadEndsTheConnectionWithItsText) {
  testing_files::ScratchDir dir;
  const std::string path = (dir.path() / "short").string();
  testing_files::write_file(path, "12345");
  auto file = std::make_shared<const UniqueFd>(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  open();
  lines->on_line = [&](Connection& c, std::string_view) {
    c.send_file({.file = file, .offset = 0, .length = 100, .failure_text = "-ERR cut"});
    c.send("never\r\n");
  };
  lines->reply = "";
  link->feed("RETR\r\nNOOP\r\n");
  EXPECT_EQ(link->output(), "12345-ERR cut");
  EXPECT_EQ(link->reason(), CloseReason::failed);
}

TEST_F(ConnectionLife, EveryWayOutTellsTheSessionOnce) {
  // Asked for after a reply: the reply goes out first.
  open();
  lines->on_line = [](Connection& c, std::string_view line) {
    if (line == "quit") c.close_after_send();
    if (line == "now") c.close_now();
    if (line == "boom") throw std::runtime_error("boom");
  };
  link->feed("a\r\nquit\r\nnot read\r\n");
  EXPECT_EQ(link->output(), "ok\r\n");  // sends after close_after_send are ignored
  EXPECT_EQ(lines->closes, std::vector<CloseReason>{CloseReason::requested});
  EXPECT_EQ(link->connection().phase(), Phase::closing);

  // At once: what was queued is dropped.
  open();
  lines->on_line = [](Connection& c, std::string_view line) {
    if (line == "now") c.close_now();
  };
  link->peer_window(0);
  link->feed("a\r\nnow\r\n");
  EXPECT_EQ(link->output(), "");
  EXPECT_EQ(lines->closes, std::vector<CloseReason>{CloseReason::requested});

  // The peer finished sending: its last lines are answered, then the end.
  open();
  link->peer_window(0);
  link->feed("a\r\nb");
  link->finish();
  EXPECT_FALSE(link->closed());  // the replies still wait for the reader
  link->peer_window(1000);
  EXPECT_EQ(link->output(), "ok\r\n");
  EXPECT_EQ(lines->closes, std::vector<CloseReason>{CloseReason::peer_closed});

  // The peer vanished: closed at once, nothing more is sent.
  open();
  link->peer_window(0);
  link->feed("a\r\n");
  link->vanish();
  EXPECT_EQ(lines->closes, std::vector<CloseReason>{CloseReason::peer_reset});

  // A session that throws loses its connection.
  open();
  lines->on_line = [](Connection&, std::string_view line) {
    if (line == "boom") throw std::runtime_error("boom");
  };
  link->feed("boom\r\n");
  EXPECT_EQ(lines->closes, std::vector<CloseReason>{CloseReason::failed});
  link->feed("more\r\n");
  EXPECT_EQ(lines->got, std::vector<std::string>{"boom"});
}

TEST_F(ConnectionLife, TimersAndPausedInput) {
  open();
  lines->on_line = [](Connection& c, std::string_view line) {
    if (line == "wait") {
      c.pause_input();
      c.wake_after(std::chrono::milliseconds(1000));
    }
  };
  lines->reply = "";
  link->feed("wait\r\nafter\r\n");
  EXPECT_EQ(lines->got, std::vector<std::string>{"wait"});  // paused: "after" waits
  link->advance(std::chrono::milliseconds(999));
  EXPECT_EQ(lines->timers, 0);
  link->advance(std::chrono::milliseconds(1));
  EXPECT_EQ(lines->timers, 1);
  EXPECT_EQ(link->take(), "tick\r\n");
  EXPECT_EQ(lines->got.size(), 1u);  // still paused
  link->connection().resume_input();
  link->turn();
  EXPECT_EQ(lines->got, (std::vector<std::string>{"wait", "after"}));
  // A later call replaces the time; zero cancels.
  link->connection().wake_after(std::chrono::milliseconds(500));
  link->connection().wake_after(std::chrono::milliseconds(2000));
  link->advance(std::chrono::milliseconds(1000));
  EXPECT_EQ(lines->timers, 1);
  link->connection().wake_after(std::chrono::milliseconds(0));
  link->advance(std::chrono::milliseconds(5000));
  EXPECT_EQ(lines->timers, 1);
}

}  // namespace
}  // namespace velmor
