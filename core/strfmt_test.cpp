#include "core/strfmt.h"

#include <gtest/gtest.h>

namespace velmor {
namespace {

TEST(Strfmt, FormatsShortAndLongTexts) {
  EXPECT_EQ(strprintf("%d-%s", 7, "x"), "7-x");
  std::string big(1000, 'a');
  EXPECT_EQ(strprintf("<%s>", big.c_str()), "<" + big + ">");
  std::string out = "head ";
  strappendf(strappendf(out, "%05d", 42), "%s", big.c_str());
  EXPECT_EQ(out, "head 00042" + big);
}

}  // namespace
}  // namespace velmor
