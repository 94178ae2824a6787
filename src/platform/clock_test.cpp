#include "platform/clock.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>

namespace tavix::platform {
namespace {

TEST(Seconds, ValuesFromOutsideSaturateInsteadOfOverflowing) {
  EXPECT_EQ(seconds(std::nan("")), Duration::zero());
  EXPECT_GT(seconds(1e300), seconds(9e9));
  EXPECT_LT(seconds(-std::numeric_limits<double>::infinity()), seconds(-9e9));
  EXPECT_GT(fromUnixSeconds(1e300), fromUnixSeconds(4102444800));  // 2100
  const TimePoint now = fromUnixSeconds(1767225600);
  EXPECT_GT(addSeconds(now, 1e300), addSeconds(now, 1e9));
  EXPECT_LT(addSeconds(now, -1e300), fromUnixSeconds(0));
}

}  // namespace
}  // namespace tavix::platform
