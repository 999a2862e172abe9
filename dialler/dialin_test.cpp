#include "dialler/dialin.h"

#include <gtest/gtest.h>

namespace velmor {
namespace {

TEST(Dialin, EntriesLastLineFirst) {
  auto entries = dialin_parse(
      "/dev/ttyS0 1 ATA ATZ 10.0.0.1 10.0.0.2 2 300 38400 7 login.scr\r\n"
      "\n"
      "  \t\n"
      "/dev/ttyS1\t2 ATS0=1\n" +
      std::string(400, 'x'));
  ASSERT_EQ(entries.size(), 3u);
  EXPECT_EQ(entries[0].driver.size(), 250u);  // cut to a field's limit
  EXPECT_EQ(entries[1].driver, "/dev/ttyS1");
  EXPECT_EQ(entries[1].port, 2);
  EXPECT_EQ(entries[1].answer, "ATS0=1");
  EXPECT_EQ(entries[1].script, "");
  const DialinEntry& e = entries[2];
  EXPECT_EQ(e.driver, "/dev/ttyS0");
  EXPECT_EQ(e.init, "ATZ");
  EXPECT_EQ(e.local, "10.0.0.1");
  EXPECT_EQ(e.remote, "10.0.0.2");
  EXPECT_EQ(e.rings, 2);
  EXPECT_EQ(e.timeout, 300);
  EXPECT_EQ(e.speed, 38400);
  EXPECT_EQ(e.extra, 7);
  EXPECT_EQ(e.script, "login.scr");
  EXPECT_TRUE(e.enabled);
}

}  // namespace
}  // namespace velmor
