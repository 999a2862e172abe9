#include "core/background.h"

#include <gtest/gtest.h>

#include <optional>
#include <stdexcept>
#include <string>
#include <vector>

namespace velmor {
namespace {

// Two busy pieces share the rounds; the one that starts a round moves on, a
// piece may leave from inside its own slice, and one that throws is dropped
// from that round's answer without stopping the others.
TEST(BackgroundWork, RoundsAreFairAndPiecesComeAndGo) {
  std::vector<std::string> ran;
  int a_left = 3;
  std::optional<BackgroundWork> b;
  BackgroundWork a("a", [&] {
    ran.push_back("a");
    return --a_left > 0;
  });
  b.emplace("b", [&] {
    ran.push_back("b");
    if (ran.size() >= 4) b.reset();  // leaves during its own slice
    return true;
  });
  BackgroundWork c("c", [&]() -> bool {
    ran.push_back("c");
    throw std::runtime_error("broken");
  });
  EXPECT_EQ(background_count(), 3u);
  EXPECT_TRUE(background_round());  // a b c
  EXPECT_TRUE(background_round());  // b c a: b leaves
  EXPECT_EQ(background_count(), 2u);
  EXPECT_FALSE(background_round());  // a c: a's last slice, c throws
  EXPECT_EQ(ran, (std::vector<std::string>{"a", "b", "c", "b", "c", "a", "a", "c"}));
  std::vector<std::string> settled;
  {
    BackgroundWork d("d", [&] { settled.push_back("d"); return false; });
    background_settle();
  }
  EXPECT_EQ(settled, std::vector<std::string>{"d"});
  EXPECT_EQ(background_count(), 2u);
}

}  // namespace
}  // namespace velmor
