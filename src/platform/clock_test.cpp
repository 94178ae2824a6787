#include "platform/clock.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <limits>
#include <vector>

namespace tavix::platform {
namespace {

using namespace std::chrono_literals;

struct VirtualClockTest : ::testing::Test {
  DispatchPool pool{2};
  SerialQueue queue{pool, "test.clock"};
  VirtualClock clock;
};

TEST_F(VirtualClockTest, TimersFireOnceInDueOrderWithTiesInOrderSetAndFollowTimersSetByTimers) {
  const TimePoint start = clock.now();
  std::vector<std::pair<std::string, Duration>> fired;  // (timer, when after start)
  auto note = [&](std::string name) { return [&, name] { fired.emplace_back(name, clock.now() - start); }; };
  clock.after(seconds(900), queue, note("late"));
  clock.after(seconds(20), queue, note("b"));
  clock.after(seconds(10), queue, [&] {
    note("a")();
    // Falls inside the same advance: must fire within it, before c.
    clock.after(seconds(5), queue, note("nested"));
  });
  clock.after(seconds(20), queue, note("c"));
  // Cancelling through a copy of the handle cancels the one timer they share.
  TimerHandle copy = clock.after(seconds(5), queue, note("cancelled"));
  copy.cancel();
  clock.advance(seconds(899.999));
  EXPECT_EQ(fired.size(), 4u);
  clock.advance(1ms);
  clock.advance(seconds(3600));
  EXPECT_EQ(fired, (std::vector<std::pair<std::string, Duration>>{
                       {"a", seconds(10)}, {"nested", seconds(15)}, {"b", seconds(20)}, {"c", seconds(20)},
                       {"late", seconds(900)}}));
  EXPECT_EQ(clock.pendingTimers(), 0u);
}

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
