#include "platform/activity.h"

#include <gtest/gtest.h>

#include <vector>

namespace tavix::platform {
namespace {

struct ActivityTest : ::testing::Test {
  DispatchPool pool{2};
  SerialQueue queue{pool, "test.activities"};
  VirtualClock clock;
  TransactionTracker transactions;
  ActivityScheduler scheduler{clock, queue, transactions};

  void settle() { queue.sync([] {}); }
};

TEST_F(ActivityTest, CheckInCallsTheHandlerThenRunsEveryInterval) {
  std::vector<ActivityState> seen;
  scheduler.checkIn("com.norvel.tavixd.dp.flush", seconds(3600),
                    [&](const std::shared_ptr<Activity>& a) { seen.push_back(a->state()); });
  settle();
  EXPECT_EQ(seen, (std::vector<ActivityState>{ActivityState::CheckIn}));
  clock.advance(seconds(3600 * 2));
  settle();
  EXPECT_EQ(seen, (std::vector<ActivityState>{ActivityState::CheckIn, ActivityState::Run, ActivityState::Run}));
  EXPECT_EQ(scheduler.state("com.norvel.tavixd.dp.flush"), ActivityState::Done);
  EXPECT_EQ(transactions.openCount(), 0u);
}

TEST_F(ActivityTest, ContinueHoldsATransactionAndBlocksOverlappingRunsUntilDone) {
  std::shared_ptr<Activity> held;
  int runs = 0;
  scheduler.checkIn("flusher", seconds(60), [&](const std::shared_ptr<Activity>& a) {
    if (a->state() != ActivityState::Run) return;
    runs++;
    EXPECT_TRUE(a->setState(ActivityState::Continue));
    held = a;
  });
  settle();
  ASSERT_TRUE(scheduler.runNow("flusher"));
  settle();
  EXPECT_EQ(runs, 1);
  EXPECT_EQ(transactions.open().count("flusher"), 1u);
  EXPECT_FALSE(scheduler.runNow("flusher"));  // still in progress
  clock.advance(seconds(300));                // due times during the run are skipped
  settle();
  EXPECT_EQ(runs, 1);

  EXPECT_TRUE(held->setState(ActivityState::Done));
  EXPECT_EQ(transactions.openCount(), 0u);
  EXPECT_FALSE(held->setState(ActivityState::Continue));  // DONE is final for this run
  clock.advance(seconds(60));
  settle();
  EXPECT_EQ(runs, 2);
}

}  // namespace
}  // namespace tavix::platform
