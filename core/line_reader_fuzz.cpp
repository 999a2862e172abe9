// Arbitrary bytes in arbitrary pieces through the line reader of a real
// Connection (the test driver): every complete line comes out whole, in
// order, never longer than the limit and never holding a line end; an
// overlong line is reported instead of cut; nothing stalls.
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "core/test_link.h"

using namespace velmor;

namespace {

struct Collect : Session {
  std::vector<std::string> lines;
  std::size_t limit = 0;
  void on_input(Connection& c) override {
    std::string_view line;
    for (;;) {
      LineResult r = c.read_line(line);
      if (r == LineResult::need_more) return;
      if (r == LineResult::overlong) {
        lines.emplace_back("\x01overlong");
        continue;
      }
      if (line.size() > limit) __builtin_trap();
      if (line.find('\n') != std::string_view::npos) __builtin_trap();
      lines.emplace_back(line);
    }
  }
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size < 3) return 0;
  const std::size_t piece = data[0] % 17 + 1;
  const std::size_t limit = data[1] % 64 + 1;
  const bool cr_too = data[2] & 1;
  std::string input(reinterpret_cast<const char*>(data + 3), size - 3);
  auto s = std::make_unique<Collect>();
  Collect* c = s.get();
  c->limit = limit;
  TestLink link(std::move(s), 80);
  link.connection().set_line_limit(limit);
  link.connection().set_line_ends(cr_too ? LineEnds::cr_too : LineEnds::lf);
  link.feed(input, piece);
  // The same bytes at once give the same lines: the split never matters.
  auto s2 = std::make_unique<Collect>();
  Collect* whole = s2.get();
  whole->limit = limit;
  TestLink again(std::move(s2), 80);
  again.connection().set_line_limit(limit);
  again.connection().set_line_ends(cr_too ? LineEnds::cr_too : LineEnds::lf);
  again.feed(input, 1);
  if (c->lines != whole->lines) __builtin_trap();
  // Every line with a line end behind it came out (the reader never stalls).
  std::size_t ends = 0;
  for (char ch : input) ends += ch == '\n' || (cr_too && ch == '\r');
  if (c->lines.size() > ends + 1) __builtin_trap();  // + an overlong line cut off by the end
  return 0;
}
